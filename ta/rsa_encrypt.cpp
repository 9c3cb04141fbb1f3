/*
 * rsa_encrypt.cpp - RSA encryption with the public key: raw, PKCS#1 v1.5
 * and OAEP, one block, with the padding's message limit checked first.
 */
#include "rsa.h"
#include "ta_log.h"

namespace {

TEE_Result rsa_encrypt_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                              uint8_t *, uint32_t *output_len, int32_t *error) {
    return rsa_cipher_update(op, input, input_len, output_len, error, "encrypt", __func__);
}

TEE_Result rsa_encrypt_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                              uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<rsa_encrypt_operation_t>(header);
    const uint32_t k = op->key_size / 8;
    const uint32_t m = op->block_len;
    *output = nullptr;
    *output_len = 0;
    heap_buf out;
    if (!rsa_output_alloc(&out, op->key_size, error))
        return TEE_SUCCESS;
    uint32_t overhead = 0;
    if (op->padding == KM_PAD_RSA_PKCS1_1_5_ENCRYPT) {
        overhead = 11;
    } else if (op->padding == KM_PAD_RSA_OAEP) {
        const uint32_t h = rsa_digest_length(op->digest);
        if (op->digest < KM_DIGEST_SHA1 || h == 0) {
            KM_ERR("Unknown digest %d", static_cast<int>(op->digest));
            *error = KM_ERROR_INCOMPATIBLE_DIGEST;
            return TEE_SUCCESS;
        }
        overhead = 2 * h + 2;
    }
    if (uint64_t{m} + overhead > k) {
        KM_ERR("Message too long, max %dB, got %dB", static_cast<int>(k) - static_cast<int>(overhead),
               static_cast<int>(m));
        *error = KM_ERROR_INVALID_INPUT_LENGTH;
        return TEE_SUCCESS;
    }
    uint32_t len = 0;
    TEE_Result res = rsa_raw(op, rsa_raw_call::encrypt, op->block, m, out.get(), &len, error);
    if (res != TEE_SUCCESS || *error)
        return res;
    // Ciphertexts are always k bytes, leading zeros included.
    rsa_left_pad(out.get(), &len, op->key_size);
    *output_len = len;
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kEncryptFns = operation_fns<rsa_encrypt_operation_t>(
    "rsa_encrypt_operation_t", rsa_encrypt_update, rsa_encrypt_finish, rsa_operation_release);

} // namespace

operation_t *create_rsa_encrypt(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return rsa_cipher_create(key_data, key_data_len, in_params, TEE_MODE_ENCRYPT, error, &kEncryptFns, __func__);
}
