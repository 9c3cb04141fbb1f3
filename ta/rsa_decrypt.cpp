/*
 * rsa_decrypt.cpp - RSA decryption with the private key: raw, PKCS#1 v1.5
 * and OAEP, one block.
 */
#include "rsa.h"
#include "ta_log.h"

namespace {

TEE_Result rsa_decrypt_update(operation_t *op, keymaster_key_param_set_t *, const uint8_t *input, uint32_t *input_len,
                              uint8_t *, uint32_t *output_len, int32_t *error) {
    return rsa_cipher_update(op, input, input_len, output_len, error, "decrypt", __func__);
}

TEE_Result rsa_decrypt_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                              uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<rsa_decrypt_operation_t>(header);
    *output = nullptr;
    *output_len = 0;
    heap_buf out(true);
    if (!rsa_output_alloc(&out, op->key_size, error))
        return TEE_SUCCESS;
    uint32_t len = 0;
    TEE_Result res = rsa_raw(op, rsa_raw_call::decrypt, op->block, op->block_len, out.get(), &len, error);
    if (res != TEE_SUCCESS || *error)
        return res;
    if (op->padding == KM_PAD_NONE) {
        // Raw results come without leading zeros; give back the whole block.
        rsa_left_pad(out.get(), &len, op->key_size);
    }
    out.set_len(len);
    *output_len = len;
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kDecryptFns = operation_fns<rsa_decrypt_operation_t>(
    "rsa_decrypt_operation_t", rsa_decrypt_update, rsa_decrypt_finish, rsa_operation_release);

} // namespace

operation_t *create_rsa_decrypt(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return rsa_cipher_create(key_data, key_data_len, in_params, TEE_MODE_DECRYPT, error, &kDecryptFns, __func__);
}
