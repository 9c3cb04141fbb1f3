/*
 * ec.cpp - the EC provider: key generation, import, export and key data on
 * the five NIST prime curves, the capability tables, and the core shared
 * by the sign and verify twins.
 */
#include "ec.h"

#include "byte_io.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

// The key size alone selects the curve and the ECDSA algorithm.
struct ec_curve_t {
    uint32_t key_size;
    uint32_t curve;
    uint32_t algorithm;
};

constexpr ec_curve_t kCurves[] = {{192, TEE_ECC_CURVE_NIST_P192, TEE_ALG_ECDSA_P192},
                                  {224, TEE_ECC_CURVE_NIST_P224, TEE_ALG_ECDSA_P224},
                                  {256, TEE_ECC_CURVE_NIST_P256, TEE_ALG_ECDSA_P256},
                                  {384, TEE_ECC_CURVE_NIST_P384, TEE_ALG_ECDSA_P384},
                                  {521, TEE_ECC_CURVE_NIST_P521, TEE_ALG_ECDSA_P521}};

const ec_curve_t *curve_of(uint32_t key_size) {
    for (const ec_curve_t &c : kCurves)
        if (c.key_size == key_size)
            return &c;
    return nullptr;
}

constexpr uint32_t kValues = 3; // x, y, d
constexpr uint32_t kAttributeIds[kValues] = {TEE_ATTR_ECC_PUBLIC_VALUE_X, TEE_ATTR_ECC_PUBLIC_VALUE_Y,
                                             TEE_ATTR_ECC_PRIVATE_VALUE};

// The key size and the three length-prefixed values of EC key data (or
// import material); false (logged in func's name) when cut short.
struct ec_values_t {
    uint32_t key_size;
    const uint8_t *data[kValues];
    uint32_t len[kValues];
};

bool read_values(byte_reader *r, ec_values_t *v, const char *func) {
    if (!r->read_u32(&v->key_size, func))
        return false;
    for (uint32_t i = 0; i < kValues; ++i)
        if (!r->read_lv(&v->data[i], &v->len[i], func))
            return false;
    return true;
}

bool supported_size(uint32_t key_size) {
    return curve_of(key_size) != nullptr;
}

constexpr key_size_rule_t kSizes{"EC", supported_size};

} // namespace

TEE_Result ec_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                           int32_t *error) {
    return provider_key_slot(
        params, KM_ORIGIN_GENERATED, key_data, key_data_len, error, [&](heap_buf *buf, TEE_Result *res) {
            uint32_t key_size = 0;
            if (!provider_generation_size(params, kSizes, &key_size, error, "ec_generate_key"))
                return false;
            TEE_Attribute curve{};
            TEE_InitValueAttribute(&curve, TEE_ATTR_ECC_CURVE, curve_of(key_size)->curve, 0);
            *res = provider_generated_pair(TEE_TYPE_ECDSA_KEYPAIR, key_size, curve, kAttributeIds, kValues,
                                           ec_field_bytes(key_size), buf, error, "ec_generate_key");
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        });
}

TEE_Result ec_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                         uint8_t **key_data, uint32_t *key_data_len, int32_t *error) {
    ec_values_t v{};
    return provider_import_slot(
        params, material, material_len, key_data, key_data_len, error,
        [&](byte_reader *r) { return read_values(r, &v, "ec_import_key"); },
        [&](heap_buf *buf, TEE_Result *res, uint32_t consumed) {
            *res = provider_import_size(params, v.key_size, kSizes, error, "ec_import_key");
            if (*res != TEE_SUCCESS || *error)
                return false;
            // The key data is the material as read: bytes after the private value are not kept.
            *res = provider_key_data(buf, nullptr, 0, material, consumed, KM_ERROR_MEMORY_ALLOCATION_FAILED, error,
                                     "ec_import_key");
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        });
}

TEE_Result ec_export_key(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                         int32_t *error) {
    const uint32_t capacity = *out_len;
    // Whatever fails, the caller is never told of more bytes than it gave room for.
    *out_len = 0;
    *error = KM_ERROR_UNKNOWN_ERROR;
    byte_reader r(key_data, key_data_len);
    uint32_t key_size = 0;
    const uint8_t *x = nullptr;
    const uint8_t *y = nullptr;
    uint32_t x_len = 0;
    uint32_t y_len = 0;
    if (!r.read_u32(&key_size) || !r.read_lv(&x, &x_len) || !r.read_lv(&y, &y_len))
        return TEE_SUCCESS;
    byte_writer w(out, capacity);
    if (!w.write_u32(key_size) || !w.write_u32(x_len) || !w.write_bytes(x, x_len) || !w.write_u32(y_len) ||
        !w.write_bytes(y, y_len))
        return TEE_SUCCESS;
    *out_len = w.written();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result ec_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                               uint32_t *key_size, int32_t *error) {
    *object = nullptr;
    if (key_size)
        *key_size = 0;
    byte_reader r(key_data, key_data_len);
    ec_values_t v{};
    if (!read_values(&r, &v, __func__))
        return TEE_ERROR_GENERIC;
    const ec_curve_t *c = curve_of(v.key_size);
    if (!c) {
        *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
        return TEE_SUCCESS;
    }
    TEE_Attribute attrs[kValues + 1] = {};
    for (uint32_t i = 0; i < kValues; ++i)
        TEE_InitRefAttribute(&attrs[i], kAttributeIds[i], v.data[i], v.len[i]);
    TEE_InitValueAttribute(&attrs[kValues], TEE_ATTR_ECC_CURVE, c->curve, 0);
    TEE_Result res = key_object(TEE_TYPE_ECDSA_KEYPAIR, v.key_size, attrs, kValues + 1, object);
    if (res != TEE_SUCCESS)
        return res;
    if (key_size)
        *key_size = v.key_size;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

/* ---- operations ---------------------------------------------------------- */

namespace {

struct ec_digest_t {
    uint32_t digest;
    uint32_t algorithm;
    uint32_t length;
};

constexpr ec_digest_t kDigests[] = {{KM_DIGEST_SHA1, TEE_ALG_SHA1, 20},
                                    {KM_DIGEST_SHA_2_224, TEE_ALG_SHA224, 28},
                                    {KM_DIGEST_SHA_2_256, TEE_ALG_SHA256, 32},
                                    {KM_DIGEST_SHA_2_384, TEE_ALG_SHA384, 48},
                                    {KM_DIGEST_SHA_2_512, TEE_ALG_SHA512, 64}};

// The digest operation of op->digest (none for KM_DIGEST_NONE) and the
// message buffer's room: false with *error set for a digest ECDSA does not
// take here, or for a TEE failure (logged, no error).
bool start_message(ec_operation_t *op, int32_t *error, const char *func) {
    uint32_t room = ec_field_bytes(op->key_size);
    if (op->digest == KM_DIGEST_MD5) {
        *error = KM_ERROR_INCOMPATIBLE_DIGEST;
        return false;
    }
    if (op->digest > KM_DIGEST_SHA_2_512) {
        *error = KM_ERROR_UNSUPPORTED_DIGEST;
        return false;
    }
    for (const ec_digest_t &d : kDigests) {
        if (d.digest != op->digest)
            continue;
        if (keyed_operation(&op->digest_operation, d.algorithm, TEE_MODE_DIGEST, 0, TEE_HANDLE_NULL,
                            tee_call_texts::standard, func, __LINE__) != TEE_SUCCESS)
            return false;
        room = d.length;
        op->message_len = room;
    }
    op->message = static_cast<uint8_t *>(ta_malloc(room));
    if (!op->message) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return false;
    }
    return true;
}

// The message buffer's size: the digest's room, or one field unhashed.
uint32_t message_room(const ec_operation_t *op) {
    return op->digest == KM_DIGEST_NONE ? ec_field_bytes(op->key_size) : op->message_len;
}

} // namespace

operation_t *ec_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                 uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func) {
    return operation_record_create<ec_operation_t>(fns, func, [&](ec_operation_t *op) {
        TEE_Result res = ec_resolve_key_data(key_data, key_data_len, &op->key, &op->key_size, error);
        if (!operation_key_resolved(res, error, &op->key, func))
            return false;
        const key_param_t *digest = provider_param(in_params, KM_TAG_DIGEST, "KM_TAG_DIGEST", error, func);
        if (!digest)
            return false;
        op->digest = digest->enumerated;
        const ec_curve_t *c = curve_of(op->key_size);
        if (!c) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unsupported key size %d", static_cast<int>(op->key_size));
            *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
            return false;
        }
        return start_message(op, error, func) &&
               keyed_operation(&op->operation, c->algorithm, mode, op->key_size, op->key, tee_call_texts::standard,
                               func) == TEE_SUCCESS;
    });
}

TEE_Result ec_operation_update(operation_t *header, keymaster_key_param_set_t *, const uint8_t *input,
                               uint32_t *input_len, uint8_t *, uint32_t *output_len, int32_t *error) {
    auto *op = operation_record<ec_operation_t>(header);
    *output_len = 0;
    if (op->digest_operation) {
        TEE_DigestUpdate(op->digest_operation, input, *input_len);
    } else {
        // Unhashed input beyond one field could not be signed anyway: it is left unconsumed.
        const uint32_t room = ec_field_bytes(op->key_size) - op->message_len;
        if (*input_len > room)
            *input_len = room;
        if (*input_len)
            TEE_MemMove(op->message + op->message_len, input, *input_len);
        op->message_len += *input_len;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

uint32_t ec_truncate_digest(uint8_t *buf, uint32_t len, uint32_t key_size) {
    if (uint64_t{len} * 8 > key_size)
        len = ec_field_bytes(key_size);
    if (uint64_t{len} * 8 > key_size) {
        // P-521: 66 bytes hold 528 bits, the leftmost 521 of them are the value.
        const uint32_t shift = 8 - key_size % 8;
        for (uint32_t i = len - 1; i > 0; --i)
            buf[i] = static_cast<uint8_t>(buf[i] >> shift | buf[i - 1] << (8 - shift));
        buf[0] = static_cast<uint8_t>(buf[0] >> shift);
    }
    return len;
}

TEE_Result ec_operation_message(ec_operation_t *op, uint32_t *len, const char *func) {
    *len = op->message_len;
    if (op->digest_operation) {
        TEE_Result res = TEE_DigestDoFinal(op->digest_operation, nullptr, 0, op->message, len);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "DigestDoFinal failed with 0x%08x\n", res);
            return res;
        }
    }
    *len = ec_truncate_digest(op->message, *len, op->key_size);
    return TEE_SUCCESS;
}

void ec_operation_release(operation_t *header, bool audit) {
    auto *op = operation_record<ec_operation_t>(header);
    record_release r(header, audit);
    r.keyed(op);
    r.operation(&op->digest_operation, false);
    r.buffer(&op->message, message_room(op));
}

/* ---- the provider --------------------------------------------------------- */

namespace {

constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_PKCS8};
constexpr uint32_t kExportFormats[] = {KM_KEY_FORMAT_X509};
const purpose_ops_t ec_sign_ops = digest_signing_table(create_ec_sign);
const purpose_ops_t ec_verify_ops = digest_signing_table(create_ec_verify);

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t ec_provider = {.algorithm = KM_ALGORITHM_EC, .name = "EC",
    .get_purpose_ops = purposes_of<nullptr, nullptr, &ec_sign_ops, &ec_verify_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count<kExportFormats>, .get_export_formats = list_write<kExportFormats>,
    .generate_key = ec_generate_key, .import_key = ec_import_key, .export_key = ec_export_key,
};
// clang-format on
