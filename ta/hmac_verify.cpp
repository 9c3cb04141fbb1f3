/*
 * hmac_verify.cpp - HMAC verification: the caller's signature against the
 * leftmost bytes of the MAC of all input.
 */
#include "hmac.h"
#include "byte_io.h"
#include "ta_log.h"

namespace {

// A signature of any other length than the MAC length is a mismatch; the
// comparison never reads past either buffer and takes the same time for
// any content.
TEE_Result hmac_verify_finish(operation_t *op, keymaster_key_param_set_t *, const uint8_t *signature,
                              uint32_t signature_len, uint8_t **output, uint32_t *output_len,
                              keymaster_key_param_set_t *, int32_t *error) {
    auto *h = operation_record<hmac_verify_operation_t>(op);
    uint8_t mac[64] = {};
    uint32_t mac_len = 0;
    *output = nullptr;
    *output_len = 0;
    TEE_Result res = hmac_operation_mac(h, mac, &mac_len, error, __func__);
    if (res != TEE_SUCCESS || *error)
        return res;
    const uint32_t want = h->mac_length / 8;
    // The length is no secret; only equal lengths are compared, in constant time.
    const bool same = signature_len == want && bytes_equal_ct(mac, signature, want);
    TEE_MemFill(mac, 0, sizeof mac);
    if (!same) {
        KM_ERR("Signature mismatch");
        *error = KM_ERROR_VERIFICATION_FAILED;
        return TEE_SUCCESS;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kVerifyFns = operation_fns<hmac_verify_operation_t>(
    "hmac_verify_operation_t", hmac_operation_update, hmac_verify_finish, hmac_operation_release);

} // namespace

operation_t *create_hmac_verify(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                                int32_t *error) {
    return hmac_operation_create(key_data, key_data_len, in_params, out_params, error, &kVerifyFns, __func__);
}
