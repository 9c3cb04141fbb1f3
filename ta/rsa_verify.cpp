/*
 * rsa_verify.cpp - RSA verification: PKCS#1 v1.5 and PSS over a digest,
 * and unhashed signatures compared block for block after the raw
 * public-key operation.
 */
#include "rsa.h"
#include "byte_io.h"
#include "ta_log.h"

namespace {

TEE_Result rsa_verify_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                             uint8_t *, uint32_t *output_len, int32_t *error) {
    *output_len = 0;
    return rsa_signature_buffer(operation_record<rsa_verify_operation_t>(op), input, input_len, error, "verify",
                                __func__);
}

// Unhashed signatures are checked as signing made them: the public-key result,
// right-aligned to the modulus length, must equal the block built from the
// buffered message (zero-padded for raw RSA, 00 01 FF..FF 00 M for PKCS#1).
TEE_Result rsa_verify_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *signature,
                             uint32_t signature_len, uint8_t **output, uint32_t *output_len,
                             keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<rsa_verify_operation_t>(header);
    const uint32_t key_bytes = op->key_size / 8;
    *output = nullptr;
    *output_len = 0;
    heap_buf work(true);
    if (!rsa_output_alloc(&work, op->key_size, error))
        return TEE_SUCCESS;
    TEE_Result res = rsa_signature_message(op, __func__);
    if (res != TEE_SUCCESS)
        return res;
    if (op->digest_operation) {
        TEE_Attribute salt{};
        const uint32_t attr_count = rsa_salt_attribute(op->padding, TEE_RSA_PSS_SALT_MAX_OR_AUTO, &salt);
        res = TEE_AsymmetricVerifyDigest(op->operation, attr_count ? &salt : nullptr, attr_count, op->block,
                                         op->block_len, signature, signature_len);
        if (res == TEE_ERROR_SIGNATURE_INVALID) {
            *error = KM_ERROR_VERIFICATION_FAILED;
            return TEE_SUCCESS;
        }
        if (res == TEE_SUCCESS)
            *error = KM_ERROR_OK;
        return res;
    }
    uint32_t len = key_bytes;
    res = TEE_AsymmetricEncrypt(op->operation, nullptr, 0, signature, signature_len, work.get(), &len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AsymmetricEncrypt failed with 0x%08x\n", res);
        return res;
    }
    rsa_left_pad(work.get(), &len, op->key_size);
    *error = bytes_equal_ct(op->block, work.get(), key_bytes) ? KM_ERROR_OK : KM_ERROR_VERIFICATION_FAILED;
    return TEE_SUCCESS;
}

const operation_fns_t kVerifyFns = operation_fns<rsa_verify_operation_t>("rsa_verify_operation_t", rsa_verify_update,
                                                                         rsa_verify_finish, rsa_signature_release);

} // namespace

operation_t *create_rsa_verify(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                               keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return rsa_signature_create(key_data, key_data_len, in_params, false, error, &kVerifyFns, __func__);
}
