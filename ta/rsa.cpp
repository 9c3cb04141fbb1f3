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
    TEE_ATTR_RSA_PRIME2,  TEE_ATTR_RSA_EXPONENT1,       TEE_ATTR_RSA_EXPONENT2,        TEE_ATTR_RSA_COEFFICIENT,
};

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

bool valid_key_size(uint32_t bits) { return bits % 8 == 0 && bits <= kRsaMaxKeyBits; }

void put_u64be(uint8_t *p, uint64_t v) {
    for (int i = 0; i < 8; ++i)
        p[i] = static_cast<uint8_t>(v >> (8 * (7 - i)));
}

struct digest_row_t {
    uint32_t digest;
    uint32_t length;
    uint32_t hash;
    uint32_t pkcs1;
    uint32_t pss;  // 0: not offered
    uint32_t oaep; // 0: not offered
};

constexpr digest_row_t kDigests[] = {
    {KM_DIGEST_MD5, 16, TEE_ALG_MD5, TEE_ALG_RSASSA_PKCS1_V1_5_MD5, 0, 0},
    {KM_DIGEST_SHA1, 20, TEE_ALG_SHA1, TEE_ALG_RSASSA_PKCS1_V1_5_SHA1, TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA1,
     TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA1_EXT},
    {KM_DIGEST_SHA_2_224, 28, TEE_ALG_SHA224, TEE_ALG_RSASSA_PKCS1_V1_5_SHA224, TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA224,
     TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA224_EXT},
    {KM_DIGEST_SHA_2_256, 32, TEE_ALG_SHA256, TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA256,
     TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA256_EXT},
    {KM_DIGEST_SHA_2_384, 48, TEE_ALG_SHA384, TEE_ALG_RSASSA_PKCS1_V1_5_SHA384, TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA384,
     TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA384_EXT},
    {KM_DIGEST_SHA_2_512, 64, TEE_ALG_SHA512, TEE_ALG_RSASSA_PKCS1_V1_5_SHA512, TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA512,
     TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA512_EXT},
};

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

TEE_Result rsa_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                            int32_t *error) {
    heap_buf buf(true);
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    *key_data = nullptr;
    *key_data_len = 0;
    *error = KM_ERROR_OK;
    do {
        res = provider_set_origin(params, KM_ORIGIN_GENERATED, error);
        if (res != TEE_SUCCESS || *error)
            break;
        const key_param_t *exponent = key_param_set_find_unique(params, KM_TAG_RSA_PUBLIC_EXPONENT);
        if (!exponent) {
            KM_ERR("No or too many KM_TAG_RSA_PUBLIC_EXPONENT specified");
            *error = KM_ERROR_INVALID_ARGUMENT;
            break;
        }
        uint8_t e[8];
        put_u64be(e, exponent->long_integer);
        const key_param_t *size = key_param_set_find_unique(params, KM_TAG_KEY_SIZE);
        if (!size) {
            KM_ERR("No or too many KM_TAG_KEY_SIZE or specified");
            *error = KM_ERROR_INVALID_ARGUMENT;
            break;
        }
        const uint32_t key_size = size->integer;
        if (!valid_key_size(key_size)) {
            KM_ERR("Invalid RSA key size %d", static_cast<int>(key_size));
            *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
            break;
        }
        object_guard obj;
        res = TEE_AllocateTransientObject(TEE_TYPE_RSA_KEYPAIR, key_size, obj.out());
        if (res != TEE_SUCCESS) {
            KM_ERR("AllocateTransientObject failed with 0x%08x\n", res);
            break;
        }
        TEE_Attribute attr{};
        TEE_InitRefAttribute(&attr, TEE_ATTR_RSA_PUBLIC_EXPONENT, e, sizeof e);
        res = TEE_GenerateKey(obj.get(), key_size, &attr, 1);
        if (res != TEE_SUCCESS) {
            KM_ERR("GenerateKey failed with 0x%08x\n", res);
            break;
        }
        // First pass: the length of every component.
        uint32_t lengths[kRsaComponents] = {};
        uint64_t total = 4;
        {
            heap_buf scratch(true);
            if (!scratch.alloc(key_size / 8)) {
                KM_ERR("Out of memory");
                *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
                break;
            }
            for (uint32_t i = 0; i < kRsaComponents && res == TEE_SUCCESS; ++i) {
                lengths[i] = scratch.len();
                res = TEE_GetObjectBufferAttribute(obj.get(), kAttributeIds[i], scratch.get(), &lengths[i]);
                total += 4 + uint64_t{lengths[i]};
            }
            if (res != TEE_SUCCESS) {
                KM_ERR("GetObjectBufferAttribute failed with 0x%08x\n", res);
                break;
            }
        }
        if (total > UINT32_MAX || !buf.alloc(static_cast<uint32_t>(total))) {
            KM_ERR("Out of memory");
            res = TEE_ERROR_OUT_OF_MEMORY;
            break;
        }
        // Second pass: each component straight behind its length word.
        byte_writer w(buf.get(), buf.len());
        if (!w.write_u32(key_size)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        bool written = true;
        for (uint32_t i = 0; i < kRsaComponents && written; ++i) {
            uint8_t *at = nullptr;
            if (!w.write_u32(lengths[i]) || !w.reserve(lengths[i], &at)) {
                res = TEE_ERROR_GENERIC;
                written = false;
                break;
            }
            uint32_t got = lengths[i];
            res = TEE_GetObjectBufferAttribute(obj.get(), kAttributeIds[i], at, &got);
            if (res != TEE_SUCCESS) {
                KM_ERR("GetObjectBufferAttribute failed with 0x%08x\n", res);
                written = false;
            } else if (got != lengths[i]) {
                KM_ERR("Buffer size modified, before %dB, after %dB", static_cast<int>(lengths[i]),
                       static_cast<int>(got));
                *error = KM_ERROR_UNKNOWN_ERROR;
                written = false;
            }
        }
        done = written;
    } while (false);
    return provider_settle_key(res, done, error, &buf, key_data, key_data_len);
}

TEE_Result rsa_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                          uint8_t **key_data, uint32_t *key_data_len, int32_t *error) {
    heap_buf buf(true);
    bool done = false;
    TEE_Result res = TEE_SUCCESS;
    *key_data = nullptr;
    *key_data_len = 0;
    *error = KM_ERROR_OK;
    do {
        byte_reader r(material, material_len);
        components_t c{};
        if (!read_components(&r, &c, __func__)) {
            res = TEE_ERROR_GENERIC;
            break;
        }
        const uint32_t consumed = material_len - r.remaining();
        res = provider_set_origin(params, KM_ORIGIN_IMPORTED, error);
        if (res != TEE_SUCCESS || *error)
            break;
        const uint64_t guessed64 = uint64_t{c.len[0]} * 8;
        const uint32_t guessed = guessed64 > UINT32_MAX ? UINT32_MAX : static_cast<uint32_t>(guessed64);
        const key_param_t *size = key_param_set_find_unique(params, KM_TAG_KEY_SIZE);
        if (size && size->integer != guessed) {
            KM_ERR("Key size mismatch (given %d, guessed %d)", static_cast<int>(size->integer),
                   static_cast<int>(guessed));
            *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
            break;
        }
        if (!size && (res = key_param_set_add(params, key_param_enum(KM_TAG_KEY_SIZE, guessed))) != TEE_SUCCESS) {
            KM_ERR("Out of memory");
            break;
        }
        if (!valid_key_size(guessed)) {
            KM_ERR("Invalid RSA key size %d", static_cast<int>(guessed));
            *error = KM_ERROR_UNSUPPORTED_KEY_SIZE;
            break;
        }
        // The exponent must fit the tag's 64 bits, whether the tag is given or derived.
        const uint32_t e_len = c.len[1];
        if (e_len > 8) {
            KM_ERR("Public exponent mismatch");
            *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
            break;
        }
        uint64_t e_value = 0;
        for (uint32_t i = 0; i < e_len; ++i)
            e_value = e_value << 8 | c.data[1][i];
        const key_param_t *exponent = key_param_set_find_unique(params, KM_TAG_RSA_PUBLIC_EXPONENT);
        if (exponent) {
            uint8_t e[8];
            put_u64be(e, exponent->long_integer);
            if (e_len && TEE_MemCompare(e + 8 - e_len, c.data[1], e_len) != 0) {
                KM_ERR("Public exponent mismatch");
                *error = KM_ERROR_IMPORT_PARAMETER_MISMATCH;
                break;
            }
        } else if ((res = key_param_set_add(params, key_param_long(KM_TAG_RSA_PUBLIC_EXPONENT, e_value))) !=
                   TEE_SUCCESS) {
            KM_ERR("Out of memory");
            break;
        }
        if (consumed > UINT32_MAX - 4 || !buf.alloc(4 + consumed)) {
            KM_ERR("Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            break;
        }
        put_u32le(buf.get(), guessed);
        TEE_MemMove(buf.get() + 4, material, consumed);
        done = true;
    } while (false);
    return provider_settle_key(res, done, error, &buf, key_data, key_data_len);
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
    object_guard obj;
    TEE_Result res = TEE_AllocateTransientObject(TEE_TYPE_RSA_KEYPAIR, bits, obj.out());
    if (res != TEE_SUCCESS) {
        KM_ERR("AllocateTransientObject failed with 0x%08x\n", res);
        return res;
    }
    res = TEE_PopulateTransientObject(obj.get(), attrs, kRsaComponents);
    if (res != TEE_SUCCESS) {
        KM_ERR("PopulateTransientObject failed with 0x%08x\n", res);
        return res;
    }
    *object = obj.release();
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
    *error = KM_ERROR_UNKNOWN_ERROR;
    int32_t ignored = 0;
    if (rsa_resolve_key_data(key_data, key_data_len, key.out(), &key_size, &ignored) != TEE_SUCCESS)
        KM_ERR("Resolve key data failed");
    if (!key.get()) {
        KM_ERR("resolve key from data stream error\n");
        return TEE_SUCCESS;
    }
    TEE_Result res = TEE_AllocateOperation(op.out(), TEE_ALG_RSA_NOPAD, TEE_MODE_EXPORT, key_size);
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AllocateOperation failed: %08x\n", res);
        return TEE_SUCCESS;
    }
    res = TEE_SetOperationKey(op.get(), key.get());
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_SetOperationKey failed: %08x\n", res);
        return TEE_SUCCESS;
    }
    res = TEE_AsymmetricExport(op.get(), TEE_EXPORT_RSA_PUBLIC_KEY_DER, out, out_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AsymmetricExport failed: %08x\n", res);
        return TEE_SUCCESS;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

/* ---- operations ---------------------------------------------------------- */

namespace {

// The first steps every RSA operation takes: the key object, a buffer of one
// block (key size / 8 bytes) and the single padding of the begin parameters.
// False, logged in the caller's name, on failure; what was made stays in the
// outputs for the record's free.
bool rsa_operation_start(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                         TEE_ObjectHandle *key, uint32_t *key_size, uint8_t **block, const key_param_t **padding,
                         int32_t *error, const char *func) {
    if (rsa_resolve_key_data(key_data, key_data_len, key, key_size, error) != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Resolve key data failed");
        return false;
    }
    *block = static_cast<uint8_t *>(ta_malloc(*key_size / 8));
    if (!*block) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return false;
    }
    *padding = key_param_set_find_unique(in_params, KM_TAG_PADDING);
    if (!*padding) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "No or too many KM_TAG_PADDING");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return false;
    }
    return true;
}

} // namespace

operation_t *rsa_signature_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  bool signing, int32_t *error, const operation_fns_t *fns, const char *func) {
    auto *op = reinterpret_cast<rsa_signature_operation_t *>(operation_record_alloc(sizeof(rsa_signature_operation_t), fns));
    if (!op) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        // The verification twin leaves the error unset: begin then reports an unknown error.
        if (signing)
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return nullptr;
    }
    bool ok = false;
    do {
        const key_param_t *padding = nullptr;
        if (!rsa_operation_start(key_data, key_data_len, in_params, &op->key, &op->key_size, &op->message, &padding,
                                 error, func))
            break;
        const uint32_t key_bytes = op->key_size / 8;
        const key_param_t *digest = key_param_set_find_unique(in_params, KM_TAG_DIGEST);
        if (!digest) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "No or too many KM_TAG_DIGEST");
            *error = KM_ERROR_INVALID_ARGUMENT;
            break;
        }
        op->padding = padding->enumerated;
        op->digest = digest->enumerated;
        if (op->padding != KM_PAD_NONE && op->padding != KM_PAD_RSA_PSS && op->padding != KM_PAD_RSA_PKCS1_1_5_SIGN) {
            *error = KM_ERROR_UNSUPPORTED_PADDING_MODE;
            break;
        }
        if (op->digest > KM_DIGEST_SHA_2_512) {
            *error = KM_ERROR_UNSUPPORTED_DIGEST;
            break;
        }
        const digest_row_t *row = digest_row(op->digest);
        uint32_t algorithm = TEE_ALG_RSA_NOPAD;
        if (op->padding == KM_PAD_NONE && row) {
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
            break;
        }
        if (op->padding == KM_PAD_RSA_PSS && (!row || !row->pss)) {
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
            break;
        }
        if (row) {
            algorithm = op->padding == KM_PAD_RSA_PSS ? row->pss : row->pkcs1;
            TEE_Result res = TEE_AllocateOperation(&op->digest_operation, row->hash, TEE_MODE_DIGEST, 0);
            if (res != TEE_SUCCESS) {
                op->digest_operation = nullptr;
                KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AllocateOperation failed with 0x%08x\n", res);
                break;
            }
        }
        if (op->padding == KM_PAD_RSA_PSS && row->length + 22 > key_bytes) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__,
                        "Too short key to fit digest, flag and salt, key_size %d, need %d", static_cast<int>(op->key_size),
                        static_cast<int>((row->length + 22) * 8));
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
            break;
        }
        // Without a digest the block is built here and run through raw RSA.
        const uint32_t mode = signing ? (row ? TEE_MODE_SIGN : TEE_MODE_DECRYPT)
                                      : (row ? TEE_MODE_VERIFY : TEE_MODE_ENCRYPT);
        TEE_Result res = TEE_AllocateOperation(&op->operation, algorithm, mode, op->key_size);
        if (res != TEE_SUCCESS) {
            op->operation = nullptr;
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AllocateOperation failed with 0x%08x\n", res);
            break;
        }
        res = TEE_SetOperationKey(op->operation, op->key);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "SetOperationKey failed with 0x%08x\n", res);
            break;
        }
        ok = true;
    } while (false);
    if (ok)
        return &op->header;
    rsa_signature_free(&op->header, fns->record_name, false, func);
    return nullptr;
}

TEE_Result rsa_signature_buffer(rsa_signature_operation_t *op, const uint8_t *input, uint32_t *input_len,
                                int32_t *error, const char *verb, const char *func) {
    const uint32_t n = *input_len;
    if (op->digest_operation) {
        TEE_DigestUpdate(op->digest_operation, input, n);
    } else {
        const uint32_t key_bytes = op->key_size / 8;
        const uint32_t limit = op->padding == KM_PAD_RSA_PKCS1_1_5_SIGN ? key_bytes - 11 : key_bytes;
        const uint64_t total = uint64_t{op->message_len} + n;
        if (total > limit) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Input too long to %s, key_size %d, input %dB", verb, static_cast<int>(op->key_size),
                        static_cast<int>(total));
            *input_len = 0;
            *error = KM_ERROR_INVALID_INPUT_LENGTH;
            return TEE_SUCCESS;
        }
        TEE_MemMove(op->message + op->message_len, input, n);
        op->message_len += n;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result rsa_signature_digest(rsa_signature_operation_t *op, const char *func) {
    uint32_t len = op->key_size / 8;
    TEE_Result res = TEE_DigestDoFinal(op->digest_operation, nullptr, 0, op->message, &len);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "DigestDoFinal failed with 0x%08x\n", res);
        return res;
    }
    op->message_len = len;
    return TEE_SUCCESS;
}

void rsa_signature_block(rsa_signature_operation_t *op) {
    const uint32_t key_bytes = op->key_size / 8;
    const uint32_t m = op->message_len;
    uint8_t *b = op->message;
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
    op->message_len = key_bytes;
}

void rsa_signature_free(operation_t *header, const char *record_name, bool soter, const char *func) {
    if (!header) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Try to free NULL %s", record_name);
        return;
    }
    auto *op = reinterpret_cast<rsa_signature_operation_t *>(header);
    if (op->key)
        TEE_FreeTransientObject(op->key);
    if (op->operation)
        TEE_FreeOperation(op->operation);
    if (!op->key || !op->operation || !op->message)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Try to free invalid %s", record_name);
    if (op->digest_operation)
        TEE_FreeOperation(op->digest_operation);
    ta_free_wiped(op->message, op->key_size / 8);
    if (soter)
        ta_free(op->soter_buf);
    ta_free(op);
}

/* ---- encryption ---------------------------------------------------------- */

operation_t *rsa_cipher_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                               uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func) {
    auto *op = reinterpret_cast<rsa_cipher_operation_t *>(operation_record_alloc(sizeof(rsa_cipher_operation_t), fns));
    if (!op) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Out of memory");
        return nullptr;
    }
    bool ok = false;
    do {
        const key_param_t *padding = nullptr;
        if (!rsa_operation_start(key_data, key_data_len, in_params, &op->key, &op->key_size, &op->input, &padding,
                                 error, func))
            break;
        const key_param_t *digest = key_param_set_find_unique(in_params, KM_TAG_DIGEST);
        op->padding = padding->enumerated;
        op->digest = digest ? digest->enumerated : static_cast<uint32_t>(KM_DIGEST_NONE);
        if (op->padding != KM_PAD_NONE && op->padding != KM_PAD_RSA_PKCS1_1_5_ENCRYPT && op->padding != KM_PAD_RSA_OAEP) {
            *error = KM_ERROR_UNSUPPORTED_PADDING_MODE;
            break;
        }
        if (op->digest > KM_DIGEST_SHA_2_512) {
            *error = KM_ERROR_UNSUPPORTED_DIGEST;
            break;
        }
        const digest_row_t *row = digest_row(op->digest);
        uint32_t algorithm = 0;
        if (op->padding == KM_PAD_RSA_OAEP)
            algorithm = row ? row->oaep : 0;
        else if (!row)
            algorithm = op->padding == KM_PAD_NONE ? TEE_ALG_RSA_NOPAD : TEE_ALG_RSAES_PKCS1_V1_5;
        if (!algorithm) {
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
            break;
        }
        TEE_Result res = TEE_AllocateOperation(&op->operation, algorithm, mode, op->key_size);
        if (res != TEE_SUCCESS) {
            op->operation = nullptr;
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "AllocateOperation failed with 0x%08x\n", res);
            break;
        }
        res = TEE_SetOperationKey(op->operation, op->key);
        if (res != TEE_SUCCESS) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "SetOperationKey failed with 0x%08x\n", res);
            break;
        }
        ok = true;
    } while (false);
    if (ok)
        return &op->header;
    rsa_cipher_free(&op->header, fns->record_name, func);
    return nullptr;
}

TEE_Result rsa_cipher_update(operation_t *header, const uint8_t *input, uint32_t *input_len, uint32_t *output_len,
                             int32_t *error, const char *verb, const char *func) {
    auto *op = reinterpret_cast<rsa_cipher_operation_t *>(header);
    *output_len = 0;
    const uint64_t total = uint64_t{op->input_len} + *input_len;
    if (total > op->key_size / 8) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Input too long to %s, key_size %d, input %dB", verb, static_cast<int>(op->key_size), static_cast<int>(total));
        *input_len = 0;
        *error = KM_ERROR_INVALID_INPUT_LENGTH;
        return TEE_SUCCESS;
    }
    TEE_MemMove(op->input + op->input_len, input, *input_len);
    op->input_len += *input_len;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

void rsa_cipher_free(operation_t *header, const char *record_name, const char *func) {
    if (!header) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Try to free NULL %s", record_name);
        return;
    }
    auto *op = reinterpret_cast<rsa_cipher_operation_t *>(header);
    if (op->key)
        TEE_FreeTransientObject(op->key);
    if (op->operation)
        TEE_FreeOperation(op->operation);
    if (!op->key || !op->operation || !op->input)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, __LINE__, "Try to free invalid %s", record_name);
    ta_free_wiped(op->input, op->key_size / 8);
    ta_free(op);
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

using create_fn = decltype(purpose_ops_t::create_operation);

constexpr purpose_ops_t cipher_table(create_fn create) {
    return purpose_ops_t{list_count_none,             list_write_none,         list_count<kCipherPaddings>,
                         list_write<kCipherPaddings>, list_count<kDigestList>, list_write<kDigestList>,
                         create,                      param_getter_padding,    param_getter_none,
                         cipher_get_digest};
}

constexpr purpose_ops_t sign_table(create_fn create) {
    return purpose_ops_t{list_count_none,           list_write_none,         list_count<kSignPaddings>,
                         list_write<kSignPaddings>, list_count<kDigestList>, list_write<kDigestList>,
                         create,                    param_getter_padding,    param_getter_none,
                         sign_get_digest};
}

const purpose_ops_t rsa_encrypt_ops = cipher_table(create_rsa_encrypt);
const purpose_ops_t rsa_decrypt_ops = cipher_table(create_rsa_decrypt);
const purpose_ops_t rsa_sign_ops = sign_table(create_rsa_sign);
const purpose_ops_t rsa_verify_ops = sign_table(create_rsa_verify);

const purpose_ops_t *rsa_get_purpose_ops(uint32_t purpose) {
    switch (purpose) {
    case KM_PURPOSE_ENCRYPT:
        return &rsa_encrypt_ops;
    case KM_PURPOSE_DECRYPT:
        return &rsa_decrypt_ops;
    case KM_PURPOSE_SIGN:
        return &rsa_sign_ops;
    case KM_PURPOSE_VERIFY:
        return &rsa_verify_ops;
    default:
        return nullptr;
    }
}

} // namespace

const algorithm_provider_t rsa_provider = {
    KM_ALGORITHM_RSA,           "RSA",
    rsa_get_purpose_ops,        list_count<kImportFormats>,
    list_write<kImportFormats>, list_count<kExportFormats>,
    list_write<kExportFormats>, rsa_generate_key,
    rsa_import_key,             rsa_export_key,
};
