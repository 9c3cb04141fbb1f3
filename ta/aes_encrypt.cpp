/*
 * aes_encrypt.cpp - AES encryption: ECB, CBC and CTR through the TEE's
 * cipher, GCM through its AE interface; PKCS#7 padding added here, the
 * GCM tag appended to the finish output.
 */
#include "aes.h"
#include "ta_log.h"

namespace {

TEE_Result aes_encrypt_update(operation_t *header, keymaster_key_param_set_t *in_params, const uint8_t *input,
                              uint32_t *input_len, uint8_t *output, uint32_t *output_len, int32_t *error) {
    auto *op = operation_record<aes_encrypt_operation_t>(header);
    const uint32_t capacity = *output_len;
    *output_len = 0;
    if (!aes_operation_aad(op, in_params, error, __func__))
        return TEE_SUCCESS;
    if (*input_len) {
        op->started = 1;
        uint32_t written = capacity;
        TEE_Result res = aes_cipher_update(op, input, *input_len, output, &written, __func__);
        if (res != TEE_SUCCESS)
            return res;
        *output_len = written;
    }
    op->processed += *input_len;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

// The GCM tag behind the padded block (if any) at out.
TEE_Result encrypt_final_gcm(aes_encrypt_operation_t *op, uint8_t *tag, int32_t *error) {
    const uint32_t want = op->mac_length / 8;
    uint32_t len = 0;
    uint32_t tag_len = want;
    TEE_Result res = TEE_AEEncryptFinal(op->operation, nullptr, 0, nullptr, &len, tag, &tag_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AEEncryptFinal failed with 0x%08x\n", res);
        return res;
    }
    if (len != 0) {
        KM_ERR("AEEncryptFinal make output %dB, expected %dB", static_cast<int>(len), 0);
        *error = KM_ERROR_UNKNOWN_ERROR;
    } else if (tag_len != want) {
        KM_ERR("AEEncryptFinal make wrong tag size %dB, expected %dB", static_cast<int>(tag_len),
               static_cast<int>(want));
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

TEE_Result aes_encrypt_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                              uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<aes_encrypt_operation_t>(header);
    *output = nullptr;
    *output_len = 0;
    const bool block_cipher = op->block_mode == KM_MODE_ECB || op->block_mode == KM_MODE_CBC;
    if (op->processed % kAesBlock != 0 && op->padding == KM_PAD_NONE && block_cipher) {
        KM_ERR("Input length %dB not a multiple of the block size", static_cast<int>(op->processed));
        *error = KM_ERROR_INVALID_INPUT_LENGTH;
        return TEE_SUCCESS;
    }
    if (op->padding != KM_PAD_PKCS7 && op->padding != KM_PAD_NONE) {
        KM_ERR("Unsupported padding %d", static_cast<int>(op->padding));
        *error = KM_ERROR_INCOMPATIBLE_PADDING_MODE;
        return TEE_SUCCESS;
    }
    const bool pkcs7 = op->padding == KM_PAD_PKCS7;
    const bool gcm = op->block_mode == KM_MODE_GCM;
    const uint32_t size = (pkcs7 ? kAesBlock : 0) + (gcm ? op->mac_length / 8 : 0);
    heap_buf out;
    if (size && !out.alloc(size)) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    uint32_t used = 0;
    TEE_Result res = TEE_SUCCESS;
    if (pkcs7) {
        const uint32_t p = kAesBlock - op->processed % kAesBlock;
        uint8_t pad[kAesBlock] = {};
        TEE_MemFill(pad, static_cast<uint8_t>(p), p);
        used = kAesBlock;
        res = aes_cipher_update(op, pad, p, out.get(), &used, __func__);
        if (res != TEE_SUCCESS)
            return res;
        if (used != kAesBlock) {
            KM_ERR("Padding input got wrong output length %dB, expected %dB", static_cast<int>(used),
                   static_cast<int>(kAesBlock));
            *error = KM_ERROR_UNKNOWN_ERROR;
            return TEE_SUCCESS;
        }
        op->processed += p;
    }
    if (gcm)
        res = encrypt_final_gcm(op, out.get() + used, error);
    else
        res = aes_cipher_final(op, error, __func__);
    if (res != TEE_SUCCESS || *error)
        return res;
    *output_len = out.len();
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kEncryptFns = operation_fns<aes_encrypt_operation_t>(
    "aes_encrypt_operation_t", aes_encrypt_update, aes_encrypt_finish, aes_operation_release);

} // namespace

operation_t *create_aes_encrypt(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                                int32_t *error) {
    return aes_operation_create(key_data, key_data_len, in_params, out_params, TEE_MODE_ENCRYPT, error, &kEncryptFns,
                                __func__);
}
