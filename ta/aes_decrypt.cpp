/*
 * aes_decrypt.cpp - AES decryption. Update holds back what may still
 * change meaning: with GCM the last tag-length bytes received (the
 * candidate tag), with PKCS#7 the last decrypted block (it may carry the
 * padding). So any split of the input gives the same output.
 */
#include <cstring>

#include "aes.h"
#include "ta_log.h"

namespace {

// Where an update writes: the caller's buffer, its room and what is used.
struct output_cursor {
    uint8_t *out;
    uint32_t capacity;
    uint32_t used;
};

// One AE decryption step into the cursor.
TEE_Result gcm_decrypt(aes_decrypt_operation_t *op, const uint8_t *in, uint32_t len, output_cursor *c) {
    if (len == 0)
        return TEE_SUCCESS;
    uint32_t written = c->capacity - c->used;
    TEE_Result res = aes_cipher_update(op, in, len, c->out + c->used, &written, "aes_decrypt_update");
    if (res == TEE_SUCCESS)
        c->used += written;
    return res;
}

// The last T bytes of everything received stay in the tag buffer; only
// what comes before them is decrypted.
TEE_Result gcm_update(aes_decrypt_operation_t *op, const uint8_t *in, uint32_t n, output_cursor *c) {
    const uint32_t t = op->mac_length / 8;
    const uint32_t f = op->tag_fill;
    uint8_t *tag = op->tag_buffer;
    if (n < t && f + n <= t) {
        std::memcpy(tag + f, in, n);
        op->tag_fill = f + n;
        return TEE_SUCCESS;
    }
    if (n < t) {
        const uint32_t spill = f + n - t;
        TEE_Result res = gcm_decrypt(op, tag, spill, c);
        if (res != TEE_SUCCESS)
            return res;
        std::memmove(tag, tag + spill, t - n);
        std::memcpy(tag + t - n, in, n);
        op->tag_fill = t;
        return TEE_SUCCESS;
    }
    TEE_Result res = gcm_decrypt(op, tag, f, c);
    if (res == TEE_SUCCESS)
        res = gcm_decrypt(op, in, n - t, c);
    if (res != TEE_SUCCESS)
        return res;
    std::memcpy(tag, in + n - t, t);
    op->tag_fill = t;
    return TEE_SUCCESS;
}

bool block_aligned_and_started(const aes_decrypt_operation_t *op) {
    return op->processed > 0 && op->processed % kAesBlock == 0;
}

TEE_Result aes_decrypt_update(operation_t *header, keymaster_key_param_set_t *in_params, const uint8_t *input,
                              uint32_t *input_len, uint8_t *output, uint32_t *output_len, int32_t *error) {
    auto *op = operation_record<aes_decrypt_operation_t>(header);
    output_cursor c{output, *output_len, 0};
    *output_len = 0;
    if (!aes_operation_aad(op, in_params, error, __func__))
        return TEE_SUCCESS;
    const uint32_t n = *input_len;
    if (n == 0) {
        *error = KM_ERROR_OK;
        return TEE_SUCCESS;
    }
    const bool pkcs7 = op->padding == KM_PAD_PKCS7;
    // The block held back last time was not the last one after all.
    if (pkcs7 && block_aligned_and_started(op)) {
        if (c.capacity < kAesBlock) {
            KM_ERR("No room for the held block, capacity %dB", static_cast<int>(c.capacity));
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        std::memcpy(c.out, op->last_block, kAesBlock);
        c.used = kAesBlock;
    }
    op->started = 1;
    op->processed += n;
    TEE_Result res = TEE_SUCCESS;
    if (op->block_mode == KM_MODE_GCM) {
        res = gcm_update(op, input, n, &c);
    } else {
        uint32_t written = c.capacity - c.used;
        res = aes_cipher_update(op, input, n, c.out + c.used, &written, __func__);
        c.used += written;
    }
    if (res != TEE_SUCCESS)
        return res;
    if (pkcs7 && block_aligned_and_started(op) && c.used >= kAesBlock) {
        c.used -= kAesBlock;
        std::memcpy(op->last_block, c.out + c.used, kAesBlock);
        TEE_MemFill(c.out + c.used, 0, kAesBlock); // plaintext the caller does not get yet
    }
    *output_len = c.used;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result decrypt_final_gcm(aes_decrypt_operation_t *op, int32_t *error) {
    uint32_t len = 0;
    TEE_Result res = TEE_AEDecryptFinal(op->operation, nullptr, 0, nullptr, &len, op->tag_buffer, op->tag_fill);
    if (res == TEE_ERROR_MAC_INVALID) {
        KM_ERR("AEDecryptFinal failed with 0x%08x\n", res);
        *error = KM_ERROR_VERIFICATION_FAILED;
        return TEE_SUCCESS;
    }
    if (res != TEE_SUCCESS) {
        KM_ERR("AEDecryptFinal failed with 0x%08x\n", res);
        return res;
    }
    if (len != 0) {
        KM_ERR("AEEncryptFinal make output %dB", static_cast<int>(len));
        *error = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

// PKCS#7: the held block ends in p bytes of value p, 1 <= p <= 16. Every
// byte is looked at whatever p is, so the time does not depend on it.
uint32_t padding_length(const uint8_t *block) {
    const uint8_t p = block[kAesBlock - 1];
    uint8_t bad = static_cast<uint8_t>(p == 0) | static_cast<uint8_t>(p > kAesBlock);
    for (uint32_t i = 0; i < kAesBlock; ++i) {
        const uint8_t in_pad = static_cast<uint8_t>(kAesBlock - i <= p);
        bad |= static_cast<uint8_t>(in_pad & static_cast<uint8_t>(block[i] != p));
    }
    return bad ? 0 : p;
}

TEE_Result aes_decrypt_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t,
                              uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<aes_decrypt_operation_t>(header);
    *output = nullptr;
    *output_len = 0;
    const bool block_cipher = op->block_mode == KM_MODE_ECB || op->block_mode == KM_MODE_CBC;
    // Checked before the TEE is asked, which would only call it a bad parameter.
    if (block_cipher && op->processed % kAesBlock != 0) {
        KM_ERR("Input data not align to block size");
        *error = KM_ERROR_INVALID_INPUT_LENGTH;
        return TEE_SUCCESS;
    }
    TEE_Result res =
        op->block_mode == KM_MODE_GCM ? decrypt_final_gcm(op, error) : aes_cipher_final(op, error, __func__);
    if (res != TEE_SUCCESS || *error)
        return res;
    if (op->padding != KM_PAD_PKCS7) {
        *error = KM_ERROR_OK;
        return TEE_SUCCESS;
    }
    const uint32_t p = padding_length(op->last_block);
    if (p == 0) {
        KM_ERR("Illegal padding");
        *error = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    const uint32_t keep = kAesBlock - p;
    if (keep) {
        heap_buf out(true);
        if (!out.alloc(keep)) {
            KM_ERR("Out of memory");
            *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
            return TEE_SUCCESS;
        }
        TEE_MemMove(out.get(), op->last_block, keep);
        *output_len = keep;
        *output = out.release();
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

// Both twins name their record the same way in the release log.
const operation_fns_t kDecryptFns = operation_fns<aes_decrypt_operation_t>(
    "aes_encrypt_operation_t", aes_decrypt_update, aes_decrypt_finish, aes_operation_release);

} // namespace

operation_t *create_aes_decrypt(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                                int32_t *error) {
    return aes_operation_create(key_data, key_data_len, in_params, out_params, TEE_MODE_DECRYPT, error, &kDecryptFns,
                                __func__);
}
