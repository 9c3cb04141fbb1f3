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
    auto *op = reinterpret_cast<rsa_decrypt_operation_t *>(header);
    const uint32_t k = op->key_size / 8;
    *output = nullptr;
    *output_len = 0;
    heap_buf out(true);
    if (!out.alloc(k)) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    uint32_t len = k;
    TEE_Result res = TEE_AsymmetricDecrypt(op->operation, nullptr, 0, op->input, op->input_len, out.get(), &len);
    if (res == TEE_ERROR_BAD_PARAMETERS) {
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AsymmetricDecrypt failed with 0x%08x", res);
        return res;
    }
    if (op->padding == KM_PAD_NONE) {
        // Raw results come without leading zeros; give back the whole block.
        TEE_MemMove(out.get() + k - len, out.get(), len);
        TEE_MemFill(out.get(), 0, k - len);
        len = k;
    }
    out.set_len(len);
    *output_len = len;
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

void rsa_decrypt_free(operation_t *op) { rsa_cipher_free(op, "rsa_decrypt_operation_t", __func__); }

const operation_fns_t kDecryptFns = {rsa_decrypt_free, rsa_decrypt_update, rsa_decrypt_finish,
                                         "rsa_decrypt_operation_t"};

} // namespace

operation_t *create_rsa_decrypt(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return rsa_cipher_create(key_data, key_data_len, in_params, TEE_MODE_DECRYPT, error, &kDecryptFns, __func__);
}
