/*
 * aes.cpp - the AES provider: key generation and import, key data, the
 * shared core of the encrypt and decrypt operations, and the capability
 * tables.
 */
#include "aes.h"

#include "algorithm_provider.h"
#include "byte_io.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

constexpr uint32_t kCbcCtrNonce = 16;
constexpr uint32_t kGcmNonce = 12;
constexpr uint32_t kMaxNonce = 16;

bool valid_key_size(uint32_t bits) {
    return bits == 128 || bits == 192 || bits == 256;
}

// A tag whose value must be a GCM tag length the TEE takes (96 to 128 bits
// in whole bytes), with what to log and answer when it is missing or not one.
struct gcm_bits_rule_t {
    uint32_t tag;
    const char *name; // the tag's name in the log line when it is absent or repeated
    int32_t missing_error;
    const char *unsupported; // logged with the value
    int32_t unsupported_error;
};

constexpr gcm_bits_rule_t kMinMacRule{KM_TAG_MIN_MAC_LENGTH, "KM_TAG_MIN_MAC_LENGTH", KM_ERROR_MISSING_MIN_MAC_LENGTH,
                                      "Invalid KM_TAG_MIN_MAC_LENGTH", KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH};
// Below 96 bits the TEE refuses the tag length anyway; saying so at begin
// gives the caller the precise error instead of an unknown one.
constexpr gcm_bits_rule_t kMacRule{KM_TAG_MAC_LENGTH, "KM_TAG_MAC_LENGTH", KM_ERROR_INVALID_ARGUMENT,
                                   "Unsupported mac length", KM_ERROR_UNSUPPORTED_MAC_LENGTH};

// The rule's tag from params into *bits; false (logged, *error set) when it breaks the rule.
bool read_gcm_tag_bits(const keymaster_key_param_set_t *params, const gcm_bits_rule_t &rule, uint32_t *bits,
                       int32_t *error, const char *func) {
    const key_param_t *p = provider_param(params, rule.tag, rule.name, error, func, rule.missing_error);
    if (!p)
        return false;
    if (p->integer < 96 || p->integer > 128 || p->integer % 8 != 0) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "%s %d", rule.unsupported, static_cast<int>(p->integer));
        *error = rule.unsupported_error;
        return false;
    }
    *bits = p->integer;
    return true;
}

// The family's vet. Generation (not import) has the GCM rule: every GCM
// block mode, or no block mode at all, needs one KM_TAG_MIN_MAC_LENGTH
// that is a GCM tag length.
TEE_Result vet_aes(keymaster_key_param_set_t *params, uint32_t, bool generating, uint32_t *, int32_t *error,
                   const char *func) {
    if (!generating)
        return TEE_SUCCESS;
    bool wanted = !key_param_set_has_tag(params, KM_TAG_BLOCK_MODE);
    for (uint32_t i = 0; params->params && i < params->length; ++i)
        if (params->params[i].tag == KM_TAG_BLOCK_MODE && params->params[i].enumerated == KM_MODE_GCM)
            wanted = true;
    if (!wanted)
        return TEE_SUCCESS;
    uint32_t bits = 0;
    read_gcm_tag_bits(params, kMinMacRule, &bits, error, func);
    return TEE_SUCCESS;
}

constexpr secret_key_family_t kAesKeys{.sizes = {"AES", valid_key_size},
                                       .tee_type = TEE_TYPE_AES,
                                       .vet = vet_aes,
                                       .generate_name = "aes_generate_key",
                                       .import_name = "aes_import_key"};

// The TEE algorithm and nonce length of a block mode, and whether it takes PKCS#7.
struct aes_mode_t {
    uint32_t block_mode;
    uint32_t algorithm;
    uint32_t nonce_len; // 0: no nonce
    bool pkcs7;
};

constexpr aes_mode_t kModes[] = {
    {KM_MODE_ECB, TEE_ALG_AES_ECB_NOPAD, 0, true},
    {KM_MODE_CBC, TEE_ALG_AES_CBC_NOPAD, kCbcCtrNonce, true},
    {KM_MODE_CTR, TEE_ALG_AES_CTR, kCbcCtrNonce, false},
    {KM_MODE_GCM, TEE_ALG_AES_GCM, kGcmNonce, false},
};

const aes_mode_t *find_mode(uint32_t block_mode) {
    for (const aes_mode_t &m : kModes)
        if (m.block_mode == block_mode)
            return &m;
    return nullptr;
}

// Steps 3 and 4 of create: block mode, padding and (GCM) the MAC length.
bool read_begin_params(aes_operation_t *op, keymaster_key_param_set_t *in_params, int32_t *error, const char *func) {
    const key_param_t *mode = provider_param(in_params, KM_TAG_BLOCK_MODE, "KM_TAG_BLOCK_MODE", error, func);
    if (!mode)
        return false;
    op->block_mode = mode->enumerated;
    const key_param_t *padding = key_param_set_find_unique(in_params, KM_TAG_PADDING);
    op->padding = padding ? padding->enumerated : static_cast<uint32_t>(KM_PAD_NONE);
    if (op->block_mode != KM_MODE_GCM)
        return true;
    return read_gcm_tag_bits(in_params, kMacRule, &op->mac_length, error, func);
}

// Step 6 of create: the nonce given or drawn initialises the operation
// and, except for ECB, goes back to the caller in out_params.
bool start_with_nonce(aes_operation_t *op, const aes_mode_t &mode, keymaster_key_param_set_t *in_params,
                      keymaster_key_param_set_t *out_params, int32_t *error, const char *func) {
    const key_param_t *given = key_param_set_find_unique(in_params, KM_TAG_NONCE);
    uint8_t nonce[kMaxNonce] = {};
    if (given) {
        if (mode.nonce_len == 0) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "ECB takes no nonce");
            *error = KM_ERROR_INVALID_TAG;
            return false;
        }
        if (given->blob.data_length != mode.nonce_len || !given->blob.data) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Invalid nonce length %d, expected %d",
                        static_cast<int>(given->blob.data_length), static_cast<int>(mode.nonce_len));
            *error = KM_ERROR_INVALID_ARGUMENT;
            return false;
        }
        TEE_MemMove(nonce, given->blob.data, mode.nonce_len);
    } else if (mode.nonce_len) {
        TEE_GenerateRandom(nonce, mode.nonce_len);
    }
    if (mode.block_mode == KM_MODE_GCM) {
        TEE_Result res = TEE_AEInit(op->operation, nonce, mode.nonce_len, op->mac_length, 0, 0);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AEInit failed with 0x%08x\n", res);
            return false;
        }
    } else {
        TEE_CipherInit(op->operation, mode.nonce_len ? nonce : nullptr, mode.nonce_len);
    }
    if (mode.nonce_len == 0)
        return true;
    heap_buf copy;
    if (!copy.alloc(mode.nonce_len)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return false;
    }
    TEE_MemMove(copy.get(), nonce, mode.nonce_len);
    key_param_t param{};
    param.tag = KM_TAG_NONCE;
    param.blob.data = copy.get();
    param.blob.data_length = mode.nonce_len;
    if (key_param_set_add(out_params, param) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return false;
    }
    copy.release(); // the parameter set owns it now
    return true;
}

// Allocates one hold-back buffer of a decryption record.
bool hold_back_buffer(uint8_t **buf, uint32_t len, int32_t *error, const char *func) {
    *buf = static_cast<uint8_t *>(ta_malloc(len));
    if (!*buf) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return false;
    }
    return true;
}

} // namespace

generate_key_fn &aes_generate_key = secret_generate_key<kAesKeys>;
import_key_fn &aes_import_key = secret_import_key<kAesKeys>;

TEE_Result aes_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                uint32_t *key_size, int32_t *error) {
    return provider_resolve_secret(kAesKeys, key_data, key_data_len, object, key_size, nullptr, error);
}

operation_t *aes_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  keymaster_key_param_set_t *out_params, uint32_t mode, int32_t *error,
                                  const operation_fns_t *fns, const char *func) {
    const bool decrypting = mode == TEE_MODE_DECRYPT;
    operation_t *header = operation_record_create<aes_operation_t>(fns, func, [&](aes_operation_t *op) {
        TEE_Result res = aes_resolve_key_data(key_data, key_data_len, &op->key, &op->key_size, error);
        if (!operation_key_resolved(res, error, &op->key, func))
            return false;
        if (!read_begin_params(op, in_params, error, func))
            return false;
        if (decrypting && op->block_mode == KM_MODE_GCM &&
            !hold_back_buffer(&op->tag_buffer, op->mac_length / 8, error, func))
            return false;
        const aes_mode_t *m = find_mode(op->block_mode);
        if (!m) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Unsupported block mode %d", static_cast<int>(op->block_mode));
            *error = KM_ERROR_UNSUPPORTED_BLOCK_MODE;
            return false;
        }
        if (op->padding != KM_PAD_NONE && !(op->padding == KM_PAD_PKCS7 && m->pkcs7)) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Padding %d not usable with block mode %d",
                        static_cast<int>(op->padding), static_cast<int>(op->block_mode));
            *error = KM_ERROR_INCOMPATIBLE_PADDING_MODE;
            return false;
        }
        if (keyed_operation(&op->operation, m->algorithm, mode, op->key_size, op->key, tee_call_texts::standard,
                            func) != TEE_SUCCESS)
            return false;
        if (!start_with_nonce(op, *m, in_params, out_params, error, func))
            return false;
        if (decrypting && op->padding == KM_PAD_PKCS7 && !hold_back_buffer(&op->last_block, kAesBlock, error, func))
            return false;
        return true;
    });
    if (!header)
        key_param_set_release(out_params);
    return header;
}

bool aes_operation_aad(aes_operation_t *op, keymaster_key_param_set_t *in_params, int32_t *error, const char *func) {
    const key_param_t *aad = key_param_set_find_unique(in_params, KM_TAG_ASSOCIATED_DATA);
    if (!aad)
        return true;
    if (op->block_mode != KM_MODE_GCM || op->started) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Associated data only with GCM, before any payload");
        *error = KM_ERROR_INVALID_TAG;
        return false;
    }
    TEE_AEUpdateAAD(op->operation, aad->blob.data, aad->blob.data_length);
    return true;
}

TEE_Result aes_cipher_update(aes_operation_t *op, const uint8_t *in, uint32_t len, uint8_t *out, uint32_t *out_len,
                             const char *func) {
    if (op->block_mode == KM_MODE_GCM) {
        TEE_Result res = TEE_AEUpdate(op->operation, in, len, out, out_len);
        if (res != TEE_SUCCESS)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AEUpdate failed with 0x%08x\n", res);
        return res;
    }
    TEE_Result res = TEE_CipherUpdate(op->operation, in, len, out, out_len);
    if (res != TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "CipherUpdate failed with 0x%08x\n", res);
    return res;
}

TEE_Result aes_cipher_final(aes_operation_t *op, int32_t *error, const char *func) {
    uint32_t len = 0;
    TEE_Result res = TEE_CipherDoFinal(op->operation, nullptr, 0, nullptr, &len);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "CipherDoFinal failed with 0x%08x\n", res);
        return res;
    }
    if (len != 0) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "CipherDoFinal make output %dB, expected %dB",
                    static_cast<int>(len), 0);
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

void aes_operation_release(operation_t *header, bool audit) {
    auto *op = operation_record<aes_operation_t>(header);
    record_release r(header, audit);
    r.keyed(op);
    r.buffer(&op->tag_buffer, op->mac_length / 8, false);
    r.buffer(&op->last_block, kAesBlock, false);
}

namespace {

constexpr uint32_t kBlockModes[] = {KM_MODE_CBC, KM_MODE_ECB, KM_MODE_CTR, KM_MODE_GCM};
constexpr uint32_t kPaddings[] = {KM_PAD_NONE, KM_PAD_PKCS7};
constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_RAW};

// A padding is authorized only for a known block mode; none given means NONE.
uint32_t aes_get_padding(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t mode = 0;
    if (param_getter_block_mode(in_params, &mode) != 0 || !find_mode(mode))
        return 1;
    if (param_getter_padding(in_params, value) != 0)
        *value = KM_PAD_NONE;
    return 0;
}

constexpr purpose_ops_t cipher_table(create_operation_fn *create) {
    // clang-format off
    return purpose_ops_t{.block_mode_count = list_count<kBlockModes>, .get_block_modes = list_write<kBlockModes>,
        .padding_count = list_count<kPaddings>, .get_paddings = list_write<kPaddings>,
        .digest_count = list_count_none, .get_digests = list_write_none,
        .create_operation = create,
        .get_padding = aes_get_padding, .get_block_mode = param_getter_block_mode, .get_digest = param_getter_none,
    };
    // clang-format on
}

const purpose_ops_t aes_encrypt_ops = cipher_table(create_aes_encrypt);
const purpose_ops_t aes_decrypt_ops = cipher_table(create_aes_decrypt);

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t aes_provider = {.algorithm = KM_ALGORITHM_AES, .name = "AES",
    .get_purpose_ops = purposes_of<&aes_encrypt_ops, &aes_decrypt_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count_none, .get_export_formats = list_write_none,
    .generate_key = aes_generate_key, .import_key = aes_import_key, .export_key = export_key_unsupported,
};
// clang-format on
