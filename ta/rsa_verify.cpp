/*
 * rsa_verify.cpp - RSA verification: PKCS#1 v1.5 and PSS over a digest,
 * and unhashed signatures compared block for block after the raw
 * public-key operation.
 */
#include "rsa.h"
#include "ta_log.h"

namespace {

constexpr uint32_t kPssSaltAny = 0xFFFFFFFEu;

TEE_Result rsa_verify_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                             uint8_t *, uint32_t *output_len, int32_t *error) {
    *output_len = 0;
    return rsa_signature_buffer(reinterpret_cast<rsa_verify_operation_t *>(op), input, input_len, error,
                                "verify", __func__);
}

// Unhashed signatures are checked as signing made them: the public-key result,
// right-aligned to the modulus length, must equal the block built from the
// buffered message (zero-padded for raw RSA, 00 01 FF..FF 00 M for PKCS#1).
TEE_Result rsa_verify_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *signature,
                             uint32_t signature_len, uint8_t **output, uint32_t *output_len,
                             keymaster_key_param_set_t *, int32_t *error) {
    auto *op = reinterpret_cast<rsa_verify_operation_t *>(header);
    const uint32_t key_bytes = op->key_size / 8;
    *output = nullptr;
    *output_len = 0;
    heap_buf work(true);
    if (!work.alloc(key_bytes)) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    TEE_Result res = TEE_SUCCESS;
    if (op->digest_operation) {
        res = rsa_signature_digest(op, __func__);
        if (res != TEE_SUCCESS)
            return res;
        TEE_Attribute salt{};
        uint32_t attr_count = 0;
        if (op->padding == KM_PAD_RSA_PSS) {
            TEE_InitValueAttribute(&salt, TEE_ATTR_RSA_PSS_SALT_LENGTH, kPssSaltAny, 0);
            attr_count = 1;
        }
        res = TEE_AsymmetricVerifyDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->message,
                                         op->message_len, signature, signature_len);
        if (res == TEE_ERROR_SIGNATURE_INVALID) {
            *error = KM_ERROR_VERIFICATION_FAILED;
            return TEE_SUCCESS;
        }
        if (res == TEE_SUCCESS)
            *error = KM_ERROR_OK;
        return res;
    }
    rsa_signature_block(op);
    uint32_t len = key_bytes;
    res = TEE_AsymmetricEncrypt(op->operation, nullptr, 0, signature, signature_len, work.get(), &len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AsymmetricEncrypt failed with 0x%08x\n", res);
        return res;
    }
    const uint32_t pad = key_bytes - len;
    uint8_t diff = 0;
    for (uint32_t i = 0; i < key_bytes; ++i)
        diff |= static_cast<uint8_t>(op->message[i] ^ (i < pad ? 0 : work.get()[i - pad]));
    *error = diff == 0 ? KM_ERROR_OK : KM_ERROR_VERIFICATION_FAILED;
    return TEE_SUCCESS;
}

void rsa_verify_free(operation_t *op) { rsa_signature_free(op, "rsa_verify_operation_t", false, __func__); }

const operation_fns_t kVerifyFns = {rsa_verify_free, rsa_verify_update, rsa_verify_finish,
                                        "rsa_verify_operation_t"};

} // namespace

operation_t *create_rsa_verify(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                               keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return rsa_signature_create(key_data, key_data_len, in_params, false, error, &kVerifyFns, __func__);
}
