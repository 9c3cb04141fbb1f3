/*
 * ec_verify.cpp - ECDSA verification: the caller's DER signature, accepted
 * only in canonical form, checked in the TEE against the digest (or up to
 * one field of unhashed input) cut to the key's bits.
 */
#include "ec.h"
#include "ec_der.h"
#include "ta_log.h"

namespace {

TEE_Result ec_verify_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *signature,
                            uint32_t signature_len, uint8_t **output, uint32_t *output_len, keymaster_key_param_set_t *,
                            int32_t *error) {
    auto *op = operation_record<ec_verify_operation_t>(header);
    *output = nullptr;
    *output_len = 0;
    uint32_t len = 0;
    TEE_Result res = ec_operation_message(op, &len, __func__);
    if (res != TEE_SUCCESS)
        return res;
    const uint32_t half = ec_field_bytes(op->key_size);
    heap_buf raw;
    if (!raw.alloc(2 * half)) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    res = der_decode_ec_signature(signature, signature_len, raw.get(), half, raw.get() + half, half);
    if (res != TEE_SUCCESS) {
        KM_ERR("Decode signature failed, 0x%08x", res);
        *error = KM_ERROR_VERIFICATION_FAILED;
        return TEE_SUCCESS;
    }
    res = TEE_AsymmetricVerifyDigest(op->operation, nullptr, 0, op->message, len, raw.get(), raw.len());
    if (res == TEE_ERROR_SIGNATURE_INVALID) {
        *error = KM_ERROR_VERIFICATION_FAILED;
        return TEE_SUCCESS;
    }
    if (res != TEE_SUCCESS) {
        KM_ERR("TEE_AsymmetricVerifyDigest return 0x%08x", res);
        return res;
    }
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kVerifyFns = operation_fns<ec_verify_operation_t>("ec_verify_operation_t", ec_operation_update,
                                                                        ec_verify_finish, ec_operation_release);

} // namespace

operation_t *create_ec_verify(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                              keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return ec_operation_create(key_data, key_data_len, in_params, TEE_MODE_VERIFY, error, &kVerifyFns, __func__);
}
