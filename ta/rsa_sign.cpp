/*
 * rsa_sign.cpp - RSA signing: PKCS#1 v1.5 and PSS over a digest, and raw
 * or PKCS#1 blocks built here for unhashed messages.
 */
#include "rsa.h"
#include "ta_log.h"

namespace {

constexpr uint32_t kPssSaltDigestLength = 0xFFFFFFFFu;
constexpr uint32_t kPssSaltLongest = 0xFFFFFFFEu;

TEE_Result rsa_sign_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                           uint8_t *, uint32_t *output_len, int32_t *error) {
    *output_len = 0;
    return rsa_signature_buffer(reinterpret_cast<rsa_sign_operation_t *>(op), input, input_len, error,
                                "sign", __func__);
}

// Hands back the signature left-padded to the modulus length: raw results
// come without leading zero bytes, and verifiers expect k bytes.
void right_align(uint8_t *out, uint32_t len, uint32_t key_bytes) {
    if (len >= key_bytes)
        return;
    TEE_MemMove(out + key_bytes - len, out, len);
    TEE_MemFill(out, 0, key_bytes - len);
}

TEE_Result rsa_sign_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                           uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = reinterpret_cast<rsa_sign_operation_t *>(header);
    const uint32_t key_bytes = op->key_size / 8;
    heap_buf out;
    *output = nullptr;
    *output_len = 0;
    TEE_Result res = TEE_SUCCESS;
    if (op->digest_operation) {
        res = rsa_signature_digest(op, __func__);
        if (res != TEE_SUCCESS)
            return res;
        if (!out.alloc(key_bytes)) {
            KM_ERR("Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        uint32_t len = key_bytes;
        TEE_Attribute salt{};
        uint32_t attr_count = 0;
        if (op->padding == KM_PAD_RSA_PSS) {
            const uint32_t h = rsa_digest_length(op->digest);
            TEE_InitValueAttribute(&salt, TEE_ATTR_RSA_PSS_SALT_LENGTH,
                                   (h + 1) * 2 <= key_bytes ? kPssSaltDigestLength : kPssSaltLongest, 0);
            attr_count = 1;
        }
        res = TEE_AsymmetricSignDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->message,
                                       op->message_len, out.get(), &len);
        if (res != TEE_SUCCESS) {
            KM_ERR("AsymmetricSignDigest failed with 0x%08x\n", res);
            return res;
        }
        out.set_len(len);
    } else {
        if (!out.alloc(key_bytes)) {
            KM_ERR("Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        rsa_signature_block(op);
        uint32_t len = key_bytes;
        res = TEE_AsymmetricDecrypt(op->operation, nullptr, 0, op->message, key_bytes, out.get(), &len);
        if (res == TEE_ERROR_BAD_PARAMETERS) {
            *error = KM_ERROR_INVALID_ARGUMENT;
            return TEE_SUCCESS;
        }
        if (res != TEE_SUCCESS) {
            KM_ERR("TEE_AsymmetricDecrypt return 0x%08x", res);
            return res;
        }
        right_align(out.get(), len, key_bytes);
    }
    *output_len = out.len();
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

void rsa_sign_free(operation_t *op) { rsa_signature_free(op, "rsa_sign_operation_t", true, __func__); }

const operation_fns_t kSignFns = {rsa_sign_free, rsa_sign_update, rsa_sign_finish, "rsa_sign_operation_t"};

} // namespace

operation_t *create_rsa_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *key_params,
                             keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    if (key_param_set_has_tag(key_params, KM_TAG_SOTER_IS_FROM_SOTER)) {
        // SOTER keys sign a document built around the message; not available in this build.
        KM_ERR("SOTER signing is not available in this build");
        *error = KM_ERROR_UNIMPLEMENTED;
        return nullptr;
    }
    return rsa_signature_create(key_data, key_data_len, in_params, true, error, &kSignFns, __func__);
}
