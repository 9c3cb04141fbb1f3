/*
 * hmac_sign.cpp - HMAC signing: the MAC of all input, truncated to the
 * requested length.
 */
#include "hmac.h"
#include "ta_log.h"

namespace {

TEE_Result hmac_sign_finish(operation_t *op, keymaster_key_param_set_t *, const uint8_t *, uint32_t, uint8_t **output,
                            uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *h = operation_record<hmac_sign_operation_t>(op);
    uint8_t mac[64] = {};
    uint32_t mac_len = 0;
    *output = nullptr;
    *output_len = 0;
    const uint32_t want = h->mac_length / 8;
    heap_buf out;
    if (!out.alloc(want)) {
        KM_ERR("Out of memory, need %dB", static_cast<int>(want));
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    TEE_Result res = hmac_operation_mac(h, mac, &mac_len, error, __func__);
    if (res != TEE_SUCCESS || *error)
        return res;
    // Truncation keeps the leftmost bytes.
    TEE_MemMove(out.get(), mac, want);
    *output_len = want;
    *output = out.release();
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kSignFns = operation_fns<hmac_sign_operation_t>("hmac_sign_operation_t", hmac_operation_update,
                                                                      hmac_sign_finish, hmac_operation_release);

} // namespace

operation_t *create_hmac_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                              keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                              int32_t *error) {
    return hmac_operation_create(key_data, key_data_len, in_params, out_params, error, &kSignFns, __func__);
}
