/*
 * rsa.cpp - the RSA provider: key generation, import, export and key
 * data, the capability tables, and the cores shared by the sign/verify and
 * encrypt/decrypt twins.
 */
#include "rsa.h"

#include "byte_io.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

constexpr uint32_t kAttributeIds[kRsaComponents] = {
    TEE_ATTR_RSA_MODULUS, TEE_ATTR_RSA_PUBLIC_EXPONENT, TEE_ATTR_RSA_PRIVATE_EXPONENT, TEE_ATTR_RSA_PRIME1,
    TEE_ATTR_RSA_PRIME2,  TEE_ATTR_RSA_EXPONENT1,       TEE_ATTR_RSA_EXPONENT2,        TEE_ATTR_RSA_COEFFICIENT};

struct components_t {
    const uint8_t *data[kRsaComponents];
    uint32_t len[kRsaComponents];
};

// Reads the eight length-prefixed components; false (logged) when cut short.
bool read_components(byte_reader *r, components_t *c, const char *func) {
    for (uint32_t i = 0; i < kRsaComponents; ++i)
        if (!r->read_lv(&c->data[i], &c->len[i], func))
            return false;
    return true;
}

bool valid_key_size(uint32_t bits) {
    return bits % 8 == 0 && bits <= kRsaMaxKeyBits;
}

constexpr key_size_rule_t kSizes{"RSA", valid_key_size};

struct digest_row_t {
    uint32_t digest;
    uint32_t length;
    uint32_t hash;
    uint32_t pkcs1;
    uint32_t pss;  // 0: not offered
    uint32_t oaep; // 0: not offered
};

constexpr digest_row_t kDigests[] = {{KM_DIGEST_MD5, 16, TEE_ALG_MD5, TEE_ALG_RSASSA_PKCS1_V1_5_MD5, 0, 0},
                                     {KM_DIGEST_SHA1, 20, TEE_ALG_SHA1, TEE_ALG_RSASSA_PKCS1_V1_5_SHA1,
                                      TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA1, TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA1_EXT},
                                     {KM_DIGEST_SHA_2_224, 28, TEE_ALG_SHA224, TEE_ALG_RSASSA_PKCS1_V1_5_SHA224,
                                      TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA224, TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA224_EXT},
                                     {KM_DIGEST_SHA_2_256, 32, TEE_ALG_SHA256, TEE_ALG_RSASSA_PKCS1_V1_5_SHA256,
                                      TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA256, TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA256_EXT},
                                     {KM_DIGEST_SHA_2_384, 48, TEE_ALG_SHA384, TEE_ALG_RSASSA_PKCS1_V1_5_SHA384,
                                      TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA384, TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA384_EXT},
                                     {KM_DIGEST_SHA_2_512, 64, TEE_ALG_SHA512, TEE_ALG_RSASSA_PKCS1_V1_5_SHA512,
                                      TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA512, TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA512_EXT}};

const digest_row_t *digest_row(uint32_t digest) {
    for (const digest_row_t &r : kDigests)
        if (r.digest == digest)
            return &r;
    return nullptr;
}

} // namespace

uint32_t rsa_digest_length(uint32_t digest) {
    const digest_row_t *r = digest_row(digest);
    return r ? r->length : 0;
}

namespace {

// The generation parameters: a single public exponent and a supported key size.
bool generation_params(const keymaster_key_param_set_t *params, uint64_t *exponent, uint32_t *key_size,
                       int32_t *error) {
    const key_param_t *e = provider_param(params, KM_TAG_RSA_PUBLIC_EXPONENT, "KM_TAG_RSA_PUBLIC_EXPONENT specified",
                                          error, "rsa_generate_key");
    if (!e)
        return false;
    *exponent = e->long_integer;
    return provider_generation_size(params, kSizes, key_size, error, "rsa_generate_key");
}

// Import's exponent rule: e must fit the tag's 64 bits, whether the tag is
// given (and then agrees with e's bytes) or derived from e.
TEE_Result import_exponent(keymaster_key_param_set_t *params, const components_t &c, int32_t *error) {
    const uint32_t e_len = c.len[1];
    if (e_len > 8) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "rsa_import_key", __LINE__, "Public exponent mismatch");
        *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
        return TEE_SUCCESS;
    }
    const key_param_t *exponent = key_param_set_find_unique(params, KM_TAG_RSA_PUBLIC_EXPONENT);
    if (exponent) {
        uint8_t e[8];
        put_u64be(e, exponent->long_integer);
        if (e_len && TEE_MemCompare(e + 8 - e_len, c.data[1], e_len) != 0) {
            KM_TRACE_AT(TEE_TRACE_ERROR, "rsa_import_key", __LINE__, "Public exponent mismatch");
            *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
        }
        return TEE_SUCCESS;
    }
    uint64_t e_value = 0;
    for (uint32_t i = 0; i < e_len; ++i)
        e_value = e_value << 8 | c.data[1][i];
    TEE_Result res = key_param_set_add(params, key_param_long(KM_TAG_RSA_PUBLIC_EXPONENT, e_value));
    if (res != TEE_SUCCESS)
        KM_TRACE_AT(TEE_TRACE_ERROR, "rsa_import_key", __LINE__, "Out of memory");
    return res;
}

} // namespace

TEE_Result rsa_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                            int32_t *error) {
    return provider_key_slot(
        params, KM_ORIGIN_GENERATED, key_data, key_data_len, error, [&](heap_buf *buf, TEE_Result *res) {
            uint64_t exponent = 0;
            uint32_t key_size = 0;
            if (!generation_params(params, &exponent, &key_size, error))
                return false;
            uint8_t e[8] = {};
            put_u64be(e, exponent);
            TEE_Attribute attr{};
            TEE_InitRefAttribute(&attr, TEE_ATTR_RSA_PUBLIC_EXPONENT, e, sizeof e);
            *res = provider_generated_pair(TEE_TYPE_RSA_KEYPAIR, key_size, attr, kAttributeIds, kRsaComponents,
                                           key_size / 8, buf, error, "rsa_generate_key");
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        });
}

TEE_Result rsa_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                          uint8_t **key_data, uint32_t *key_data_len, int32_t *error) {
    components_t c{};
    return provider_import_slot(
        params, material, material_len, key_data, key_data_len, error,
        [&](byte_reader *r) { return read_components(r, &c, "rsa_import_key"); },
        [&](heap_buf *buf, TEE_Result *res, uint32_t consumed) {
            const uint64_t guessed64 = uint64_t{c.len[0]} * 8;
            const uint32_t guessed = guessed64 > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(guessed64);
            *res = provider_import_size(params, guessed, kSizes, error, "rsa_import_key");
            if (*res != TEE_SUCCESS || *error)
                return false;
            *res = import_exponent(params, c, error);
            if (*res != TEE_SUCCESS || *error)
                return false;
            *res = provider_key_data(buf, &guessed, 1, material, consumed, KM_ERROR_MEMORY_ALLOCATION_FAILED, error,
                                     "rsa_import_key");
            return *res == TEE_SUCCESS && *error == KM_ERROR_OK;
        });
}

TEE_Result rsa_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                uint32_t *key_size, int32_t *error) {
    *object = nullptr;
    if (key_size)
        *key_size = 0;
    byte_reader r(key_data, key_data_len);
    uint32_t bits = 0;
    components_t c{};
    if (!r.read_u32(&bits) || !read_components(&r, &c, __func__))
        return TEE_ERROR_GENERIC;
    TEE_Attribute attrs[kRsaComponents] = {};
    for (uint32_t i = 0; i < kRsaComponents; ++i)
        TEE_InitRefAttribute(&attrs[i], kAttributeIds[i], c.data[i], c.len[i]);
    TEE_Result res = key_object(TEE_TYPE_RSA_KEYPAIR, bits, attrs, kRsaComponents, object);
    if (res != TEE_SUCCESS)
        return res;
    if (key_size)
        *key_size = bits;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result rsa_export_key(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                          int32_t *error) {
    object_guard key;
    operation_guard op;
    uint32_t key_size = 0;
    const uint32_t capacity = *out_len;
    *error = KM_ERROR_UNKNOWN_ERROR;
    // Whatever fails, the caller is never told of more bytes than it gave room for.
    *out_len = 0;
    int32_t ignored = 0;
    if (rsa_resolve_key_data(key_data, key_data_len, key.out(), &key_size, &ignored) != TEE_SUCCESS)
        KM_ERR("Resolve key data failed");
    if (!key.get()) {
        KM_ERR("resolve key from data stream error\n");
        return TEE_SUCCESS;
    }
    if (keyed_operation(op.out(), TEE_ALG_RSA_NOPAD, TEE_MODE_EXPORT, key_size, key.get(), tee_call_texts::prefixed) !=
        TEE_SUCCESS)
        return TEE_SUCCESS;
    uint32_t len = capacity;
    TEE_Result res = TEE_AsymmetricExport(op.get(), TEE_EXPORT_RSA_PUBLIC_KEY_DER, out, &len);
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AsymmetricExport failed: %08x\n", res);
        return TEE_SUCCESS;
    }
    *out_len = len;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

/* ---- operations ---------------------------------------------------------- */

namespace {

// The first steps of every RSA create: the record of fns's kind, its key
// object, its one-block buffer, and the single padding and digest of the
// begin parameters (a digest is required for signatures). Null on failure,
// logged in the caller's name, with what was made released quietly.
rsa_operation_t *rsa_record_start(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  bool digest_required, int32_t oom_error, int32_t *error, const operation_fns_t *fns,
                                  const char *func) {
    bool allocated = false;
    operation_t *header = operation_record_create<rsa_operation_t>(fns, func, [&](rsa_operation_t *op) {
        allocated = true;
        TEE_Result res = rsa_resolve_key_data(key_data, key_data_len, &op->key, &op->key_size, error);
        if (!operation_key_resolved(res, error, &op->key, func))
            return false;
        op->block = static_cast<uint8_t *>(ta_malloc(op->key_size / 8));
        if (!op->block) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return false;
        }
        const key_param_t *padding = provider_param(in_params, KM_TAG_PADDING, "KM_TAG_PADDING", error, func);
        if (!padding)
            return false;
        const key_param_t *digest = digest_required
                                        ? provider_param(in_params, KM_TAG_DIGEST, "KM_TAG_DIGEST", error, func)
                                        : key_param_set_find_unique(in_params, KM_TAG_DIGEST);
        if (!digest && digest_required)
            return false;
        op->padding = padding->enumerated;
        op->digest = digest ? digest->enumerated : static_cast<uint32_t>(KM_DIGEST_NONE);
        return true;
    });
    if (header)
        return operation_record<rsa_operation_t>(header);
    // oom_error answers a missing record only; the steps set their own errors.
    if (!allocated && oom_error)
        *error = oom_error;
    return nullptr;
}

// The last step of every RSA create: the keyed RSA operation. The record
// (header) or null, with the record destroyed on failure.
operation_t *rsa_record_finish(rsa_operation_t *op, bool ok, uint32_t algorithm, uint32_t mode, const char *func) {
    if (ok && keyed_operation(&op->operation, algorithm, mode, op->key_size, op->key, tee_call_texts::standard, func) ==
                  TEE_SUCCESS)
        return &op->header;
    operation_destroy(&op->header, record_state::partial);
    return nullptr;
}

} // namespace

namespace {

// The TEE algorithm and mode of a signature operation, from its padding and
// digest; false with *error set when the pair is refused.
bool signature_algorithm(rsa_signature_operation_t *op, bool signing, const digest_row_t **row, uint32_t *algorithm,
                         uint32_t *mode, int32_t *error, const char *func) {
    const uint32_t key_bytes = op->key_size / 8;
    if (op->padding != KM_PAD_NONE && op->padding != KM_PAD_RSA_PSS && op->padding != KM_PAD_RSA_PKCS1_1_5_SIGN) {
        *error = KM_ERROR_UNSUPPORTED_PADDING_MODE;
        return false;
    }
    if (op->digest > KM_DIGEST_SHA_2_512) {
        *error = KM_ERROR_UNSUPPORTED_DIGEST;
        return false;
    }
    *row = digest_row(op->digest);
    if ((op->padding == KM_PAD_NONE && *row) || (op->padding == KM_PAD_RSA_PSS && (!*row || !(*row)->pss))) {
        *error = KM_ERROR_INCOMPATIBLE_DIGEST;
        return false;
    }
    if (op->padding == KM_PAD_RSA_PSS && (*row)->length + 22 > key_bytes) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Too short key to fit digest, flag and salt, key_size %d, need %d",
                    static_cast<int>(op->key_size), static_cast<int>(((*row)->length + 22) * 8));
        *error = KM_ERROR_INCOMPATIBLE_DIGEST;
        return false;
    }
    // Without a digest the block is built here and run through raw RSA.
    *algorithm = !*row ? TEE_ALG_RSA_NOPAD : (op->padding == KM_PAD_RSA_PSS ? (*row)->pss : (*row)->pkcs1);
    *mode = signing ? (*row ? TEE_MODE_SIGN : TEE_MODE_DECRYPT) : (*row ? TEE_MODE_VERIFY : TEE_MODE_ENCRYPT);
    return true;
}

} // namespace

operation_t *rsa_signature_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  bool signing, int32_t *error, const operation_fns_t *fns, const char *func) {
    // The verification twin leaves the error of a missing record unset: begin then reports an unknown error.
    rsa_operation_t *base = rsa_record_start(key_data, key_data_len, in_params, true,
                                             signing ? KM_ERROR_MEMORY_ALLOCATION_FAILED : 0, error, fns, func);
    if (!base)
        return nullptr;
    auto *op = static_cast<rsa_signature_operation_t *>(base);
    const digest_row_t *row = nullptr;
    uint32_t algorithm = 0;
    uint32_t mode = 0;
    bool ok = signature_algorithm(op, signing, &row, &algorithm, &mode, error, func);
    if (ok && row)
        ok = keyed_operation(&op->digest_operation, row->hash, TEE_MODE_DIGEST, 0, TEE_HANDLE_NULL,
                             tee_call_texts::standard, func, __LINE__) == TEE_SUCCESS;
    return rsa_record_finish(op, ok, algorithm, mode, func);
}

TEE_Result rsa_signature_buffer(rsa_signature_operation_t *op, const uint8_t *input, uint32_t *input_len,
                                int32_t *error, const char *verb, const char *func) {
    const uint32_t n = *input_len;
    if (op->digest_operation) {
        TEE_DigestUpdate(op->digest_operation, input, n);
    } else {
        const uint32_t key_bytes = op->key_size / 8;
        const uint32_t limit = op->padding == KM_PAD_RSA_PKCS1_1_5_SIGN ? key_bytes - 11 : key_bytes;
        const uint64_t total = uint64_t{op->block_len} + n;
        if (total > limit) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Input too long to %s, key_size %d, input %dB", verb,
                        static_cast<int>(op->key_size), static_cast<int>(total));
            *input_len = 0;
            *error = KM_ERROR_INVALID_INPUT_LENGTH;
            return TEE_SUCCESS;
        }
        TEE_MemMove(op->block + op->block_len, input, n);
        op->block_len += n;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result rsa_signature_message(rsa_signature_operation_t *op, const char *func) {
    const uint32_t key_bytes = op->key_size / 8;
    if (op->digest_operation) {
        uint32_t len = key_bytes;
        TEE_Result res = TEE_DigestDoFinal(op->digest_operation, nullptr, 0, op->block, &len);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "DigestDoFinal failed with 0x%08x\n", res);
            return res;
        }
        op->block_len = len;
        return TEE_SUCCESS;
    }
    const uint32_t m = op->block_len;
    uint8_t *b = op->block;
    TEE_MemMove(b + key_bytes - m, b, m);
    if (op->padding == KM_PAD_RSA_PKCS1_1_5_SIGN) {
        // 00 01 FF..FF 00 M: the update limit leaves at least eight 0xFF bytes.
        TEE_MemFill(b, 0xFF, key_bytes - m - 1);
        b[key_bytes - m - 1] = 0x00;
        b[0] = 0x00;
        b[1] = 0x01;
    } else {
        TEE_MemFill(b, 0x00, key_bytes - m);
    }
    op->block_len = key_bytes;
    return TEE_SUCCESS;
}

void rsa_signature_release(operation_t *header, bool audit) {
    rsa_operation_release(header, audit);
    auto *op = operation_record<rsa_signature_operation_t>(header);
    record_release r(header, audit);
    r.operation(&op->digest_operation, false);
    r.buffer(&op->soter_buf, op->soter_capacity, false);
}

bool rsa_output_alloc(heap_buf *out, uint32_t key_size, int32_t *error, const char *func) {
    if (out->alloc(key_size / 8))
        return true;
    KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
    *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
    return false;
}

TEE_Result rsa_raw(rsa_operation_t *op, rsa_raw_call call, const uint8_t *in, uint32_t in_len, uint8_t *out,
                   uint32_t *out_len, int32_t *error, const char *func) {
    uint32_t len = op->key_size / 8;
    const TEE_Result res = call == rsa_raw_call::encrypt
                               ? TEE_AsymmetricEncrypt(op->operation, nullptr, 0, in, in_len, out, &len)
                               : TEE_AsymmetricDecrypt(op->operation, nullptr, 0, in, in_len, out, &len);
    if (res == TEE_ERROR_BAD_PARAMETERS) {
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    if (res != TEE_SUCCESS) {
        if (call == rsa_raw_call::encrypt)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "TEE_AsymmetricEncrypt failed with 0x%08x", res);
        else if (call == rsa_raw_call::decrypt)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "TEE_AsymmetricDecrypt failed with 0x%08x", res);
        else
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "TEE_AsymmetricDecrypt return 0x%08x", res);
        return res;
    }
    *out_len = len;
    return TEE_SUCCESS;
}

void rsa_left_pad(uint8_t *out, uint32_t *len, uint32_t key_size) {
    right_align(out, *len, key_size / 8);
    if (*len < key_size / 8)
        *len = key_size / 8;
}

/* ---- encryption ---------------------------------------------------------- */

operation_t *rsa_cipher_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                               uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func) {
    rsa_operation_t *op = rsa_record_start(key_data, key_data_len, in_params, false, 0, error, fns, func);
    if (!op)
        return nullptr;
    uint32_t algorithm = 0;
    if (op->padding != KM_PAD_NONE && op->padding != KM_PAD_RSA_PKCS1_1_5_ENCRYPT && op->padding != KM_PAD_RSA_OAEP) {
        *error = KM_ERROR_UNSUPPORTED_PADDING_MODE;
    } else if (op->digest > KM_DIGEST_SHA_2_512) {
        *error = KM_ERROR_UNSUPPORTED_DIGEST;
    } else {
        const digest_row_t *row = digest_row(op->digest);
        if (op->padding == KM_PAD_RSA_OAEP)
            algorithm = row ? row->oaep : 0;
        else if (!row)
            algorithm = op->padding == KM_PAD_NONE ? TEE_ALG_RSA_NOPAD : TEE_ALG_RSAES_PKCS1_V1_5;
        if (!algorithm)
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
    }
    return rsa_record_finish(op, algorithm != 0, algorithm, mode, func);
}

TEE_Result rsa_cipher_update(operation_t *header, const uint8_t *input, uint32_t *input_len, uint32_t *output_len,
                             int32_t *error, const char *verb, const char *func) {
    auto *op = operation_record<rsa_cipher_operation_t>(header);
    *output_len = 0;
    const uint64_t total = uint64_t{op->block_len} + *input_len;
    if (total > op->key_size / 8) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Input too long to %s, key_size %d, input %dB", verb,
                    static_cast<int>(op->key_size), static_cast<int>(total));
        *input_len = 0;
        *error = KM_ERROR_INVALID_INPUT_LENGTH;
        return TEE_SUCCESS;
    }
    TEE_MemMove(op->block + op->block_len, input, *input_len);
    op->block_len += *input_len;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

void rsa_operation_release(operation_t *header, bool audit) {
    auto *op = operation_record<rsa_operation_t>(header);
    record_release r(header, audit);
    r.keyed(op);
    r.buffer(&op->block, op->key_size / 8);
}

/* ---- the provider --------------------------------------------------------- */

namespace {

constexpr uint32_t kCipherPaddings[] = {KM_PAD_NONE, KM_PAD_RSA_PKCS1_1_5_ENCRYPT, KM_PAD_RSA_OAEP};
constexpr uint32_t kSignPaddings[] = {KM_PAD_NONE, KM_PAD_RSA_PSS, KM_PAD_RSA_PKCS1_1_5_SIGN};
constexpr uint32_t kDigestList[] = {KM_DIGEST_NONE,      KM_DIGEST_MD5,       KM_DIGEST_SHA1,     KM_DIGEST_SHA_2_224,
                                    KM_DIGEST_SHA_2_256, KM_DIGEST_SHA_2_384, KM_DIGEST_SHA_2_512};
constexpr uint32_t kImportFormats[] = {KM_KEY_FORMAT_PKCS8};
constexpr uint32_t kExportFormats[] = {KM_KEY_FORMAT_X509};

// A digest matters for encryption only with OAEP.
uint32_t cipher_get_digest(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t padding = 0;
    if (param_getter_padding(in_params, &padding) != 0 || padding != KM_PAD_RSA_OAEP)
        return 1;
    return param_getter_digest(in_params, value);
}

uint32_t sign_get_digest(keymaster_key_param_set_t *in_params, uint32_t *value) {
    uint32_t padding = 0;
    if (param_getter_padding(in_params, &padding) != 0)
        return 1;
    if (padding != KM_PAD_NONE && padding != KM_PAD_RSA_PSS && padding != KM_PAD_RSA_PKCS1_1_5_SIGN)
        return 1;
    return param_getter_digest(in_params, value);
}

constexpr purpose_ops_t rsa_table(create_operation_fn *create, bool signing) {
    const auto padding_count = signing ? list_count<kSignPaddings> : list_count<kCipherPaddings>;
    const auto paddings = signing ? list_write<kSignPaddings> : list_write<kCipherPaddings>;
    const auto get_digest = signing ? sign_get_digest : cipher_get_digest;
    // clang-format off
    return purpose_ops_t{.block_mode_count = list_count_none, .get_block_modes = list_write_none,
        .padding_count = padding_count, .get_paddings = paddings,
        .digest_count = list_count<kDigestList>, .get_digests = list_write<kDigestList>,
        .create_operation = create,
        .get_padding = param_getter_padding, .get_block_mode = param_getter_none, .get_digest = get_digest,
    };
    // clang-format on
}

const purpose_ops_t rsa_encrypt_ops = rsa_table(create_rsa_encrypt, false);
const purpose_ops_t rsa_decrypt_ops = rsa_table(create_rsa_decrypt, false);
const purpose_ops_t rsa_sign_ops = rsa_table(create_rsa_sign, true);
const purpose_ops_t rsa_verify_ops = rsa_table(create_rsa_verify, true);

} // namespace

// The table as the interface lists its slots, in pairs.
// clang-format off
const algorithm_provider_t rsa_provider = {.algorithm = KM_ALGORITHM_RSA, .name = "RSA",
    .get_purpose_ops = purposes_of<&rsa_encrypt_ops, &rsa_decrypt_ops, &rsa_sign_ops, &rsa_verify_ops>,
    .import_format_count = list_count<kImportFormats>, .get_import_formats = list_write<kImportFormats>,
    .export_format_count = list_count<kExportFormats>, .get_export_formats = list_write<kExportFormats>,
    .generate_key = rsa_generate_key, .import_key = rsa_import_key, .export_key = rsa_export_key,
};
// clang-format on
