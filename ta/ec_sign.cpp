/*
 * ec_sign.cpp - ECDSA signing: the digest (or up to one field of unhashed
 * input) cut to the key's bits, signed in the TEE and returned in DER.
 */
#include "ec.h"
#include "ec_der.h"
#include "ta_log.h"

namespace {

TEE_Result ec_sign_finish(operation_t *header, keymaster_key_param_set_t *, const uint8_t *, uint32_t, uint8_t **output,
                          uint32_t *output_len, keymaster_key_param_set_t *, int32_t *error) {
    auto *op = operation_record<ec_sign_operation_t>(header);
    *output = nullptr;
    *output_len = 0;
    uint32_t len = 0;
    TEE_Result res = ec_operation_message(op, &len, __func__);
    if (res != TEE_SUCCESS)
        return res;
    heap_buf raw;
    if (!raw.alloc(2 * ec_field_bytes(op->key_size))) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    uint32_t raw_len = raw.len();
    res = TEE_AsymmetricSignDigest(op->operation, nullptr, 0, op->message, len, raw.get(), &raw_len);
    if (res != TEE_SUCCESS) {
        KM_ERR("AsymmetricSignDigest failed with 0x%08x\n", res);
        return res;
    }
    const uint32_t half = raw_len / 2;
    uint32_t der_len = 0;
    uint8_t *der = der_encode_ec_signature(raw.get(), half, raw.get() + half, half, &der_len);
    if (!der) {
        KM_ERR("Out of memory");
        *error = KM_ERROR_MEMORY_ALLOCATION_FAILED;
        return TEE_SUCCESS;
    }
    *output = der;
    *output_len = der_len;
    *error = KM_ERROR_OK;
    return TEE_SUCCESS;
}

const operation_fns_t kSignFns = operation_fns<ec_sign_operation_t>("ec_sign_operation_t", ec_operation_update,
                                                                    ec_sign_finish, ec_operation_release);

} // namespace

operation_t *create_ec_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *,
                            keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *, int32_t *error) {
    return ec_operation_create(key_data, key_data_len, in_params, TEE_MODE_SIGN, error, &kSignFns, __func__);
}
