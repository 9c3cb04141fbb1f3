/*
 * hmac.cpp - the HMAC provider: key generation and import, key data, and
 * the capability tables.
 */
#include "hmac.h"

#include "algorithm_provider.h"
#include "byte_io.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

struct hmac_digest_t {
    uint32_t digest;
    uint32_t key_type;
    uint32_t min_key_bits;
    uint32_t max_key_bits;
    uint32_t max_min_mac_bits;
    uint32_t algorithm;
};

constexpr hmac_digest_t kDigestTable[] = {
    {KM_DIGEST_MD5, TEE_TYPE_HMAC_MD5, 64, 512, 128, TEE_ALG_HMAC_MD5},
    {KM_DIGEST_SHA1, TEE_TYPE_HMAC_SHA1, 80, 512, 160, TEE_ALG_HMAC_SHA1},
    {KM_DIGEST_SHA_2_224, TEE_TYPE_HMAC_SHA224, 112, 512, 224, TEE_ALG_HMAC_SHA224},
    {KM_DIGEST_SHA_2_256, TEE_TYPE_HMAC_SHA256, 192, 1024, 256, TEE_ALG_HMAC_SHA256},
    {KM_DIGEST_SHA_2_384, TEE_TYPE_HMAC_SHA384, 256, 1024, 384, TEE_ALG_HMAC_SHA384},
    {KM_DIGEST_SHA_2_512, TEE_TYPE_HMAC_SHA512, 256, 1024, 512, TEE_ALG_HMAC_SHA512}};

bool valid_bit_length(uint32_t bits) {
    return bits >= 64 && bits % 8 == 0;
}

// The family's vet, the same for generation and import: the minimum MAC
// length and digest rules; the digest's row gives the TEE key type.
TEE_Result vet_hmac(keymaster_key_param_set_t *params, uint32_t key_size, bool, uint32_t *tee_type, int32_t *error,
                    const char *func) {
    const key_param_t *min_mac =
        provider_param(params, KM_TAG_MIN_MAC_LENGTH, "KM_TAG_MIN_MAC_LENGTH or specified", error, func);
    if (!min_mac)
        return TEE_SUCCESS;
    if (!valid_bit_length(min_mac->integer)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid KM_TAG_MIN_MAC_LENGTH %d",
                    static_cast<int>(min_mac->integer));
        *error = KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH;
        return TEE_SUCCESS;
    }
    const key_param_t *digest =
        provider_param(params, KM_TAG_DIGEST, "KM_TAG_DIGEST", error, func, KM_ERROR_UNSUPPORTED_DIGEST);
    if (!digest)
        return TEE_SUCCESS;
    const hmac_digest_t *row = nullptr;
    for (const hmac_digest_t &r : kDigestTable)
        if (r.digest == digest->enumerated)
            row = &r;
    if (!row) {
        *error = KM_ERROR_UNSUPPORTED_DIGEST;
        return TEE_SUCCESS;
    }
    if (key_size < row->min_key_bits || key_size > row->max_key_bits) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid HMAC key size %d", static_cast<int>(key_size));
        *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
        return TEE_SUCCESS;
    }
    if (min_mac->integer > row->max_min_mac_bits) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid KM_TAG_MIN_MAC_LENGTH %d",
                    static_cast<int>(min_mac->integer));
        *error = KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH;
        return TEE_SUCCESS;
    }
    *tee_type = row->key_type;
    return TEE_SUCCESS;
}

constexpr secret_key_family_t kHmacKeys{.sizes = {"hmac", valid_bit_length},
                                        .tee_type = 0,
                                        .vet = vet_hmac,
                                        .generate_name = "hmac_generate_key",
                                        .import_name = "hmac_import_key"};

} // namespace

uint32_t hmac_algorithm_for_key_type(uint32_t key_type) {
    for (const hmac_digest_t &r : kDigestTable)
        if (r.key_type == key_type)
            return r.algorithm;
    return 0;
}

generate_key_fn &hmac_generate_key = secret_generate_key<kHmacKeys>;
import_key_fn &hmac_import_key = secret_import_key<kHmacKeys>;

TEE_Result hmac_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                 uint32_t *key_size, uint32_t *key_type, int32_t *error) {
    return provider_resolve_secret(kHmacKeys, key_data, key_data_len, object, key_size, key_type, error);
}

operation_t *hmac_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                   keymaster_key_param_set_t *out_params, int32_t *error, const operation_fns_t *fns,
                                   const char *func) {
    operation_t *header = operation_record_create<hmac_operation_t>(fns, func, [&](hmac_operation_t *op) {
        uint32_t key_type = 0;
        TEE_Result res = hmac_resolve_key_data(key_data, key_data_len, &op->key, &op->key_size, &key_type, error);
        if (!operation_key_resolved(res, error, &op->key, func))
            return false;
        const key_param_t *mac_length = provider_param(in_params, KM_TAG_MAC_LENGTH, "KM_TAG_MAC_LENGTH", error, func);
        if (!mac_length)
            return false;
        op->mac_length = mac_length->integer;
        const uint32_t algorithm = hmac_algorithm_for_key_type(key_type);
        if (!algorithm) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unsupported key type");
            *error = KM_ERROR_INVALID_KEY_BLOB;
            return false;
        }
        if (keyed_operation(&op->operation, algorithm, TEE_MODE_MAC, op->key_size, op->key, tee_call_texts::standard,
                            func) != TEE_SUCCESS)
            return false;
        TEE_MACInit(op->operation, nullptr, 0);
        return true;
    });
    if (!header)
        key_param_set_release(out_params);
    return header;
}

TEE_Result hmac_operation_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input,
                                 uint32_t *input_len, uint8_t *, uint32_t *output_len, int32_t *error) {
    TEE_MACUpdate(operation_record<hmac_operation_t>(op)->operation, input, *input_len);
    *output_len = 0;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result hmac_operation_mac(hmac_operation_t *op, uint8_t *mac, uint32_t *mac_len, int32_t *error, const char *func) {
    *mac_len = 64;
    TEE_Result res = TEE_MACComputeFinal(op->operation, nullptr, 0, mac, mac_len);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "MACComputeFinal failed with 0x%08x\n", res);
        return res;
    }
    if (op->mac_length / 8 > *mac_len) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Too short output of HMAC operation, expect at least %dB, got %dB",
                    static_cast<int>(op->mac_length / 8), static_cast<int>(*mac_len));
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

void hmac_operation_release(operation_t *header, bool audit) {
    record_release(header, audit).keyed(operation_record<hmac_operation_t>(header));
}

namespace {

constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_RAW};
const purpose_ops_t hmac_sign_ops = digest_signing_table(create_hmac_sign);
const purpose_ops_t hmac_verify_ops = digest_signing_table(create_hmac_verify);

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t hmac_provider = {.algorithm = KM_ALGORITHM_HMAC, .name = "HMAC",
    .get_purpose_ops = purposes_of<nullptr, nullptr, &hmac_sign_ops, &hmac_verify_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count_none, .get_export_formats = list_write_none,
    .generate_key = hmac_generate_key, .import_key = hmac_import_key, .export_key = export_key_unsupported,
};
// clang-format on
