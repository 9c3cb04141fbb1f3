/*
 * soter.cpp - the SOTER state and the SOTER commands that act on it. The
 * state is shared by every session and loaded on first use; the TEE
 * delivers one call at a time, so it needs no lock.
 */
#include "soter.h"

#include "ta_heap.h"
#include "ta_log.h"
#include "tee_guard.h"

namespace {

// Zero-initialised aggregates: no constructors run at load.
uint32_t ready_flag = 0;
soter_key_pair attk = {};
soter_prop_set props = {};

constexpr int32_t kVerifyNoKey = -1;
constexpr int32_t kVerifyFailed = -2;
constexpr int32_t kExportNotReady = -1;
constexpr uint32_t kVerifyAttempts = 3;

} // namespace

bool soter_is_ready() {
    return ready_flag == 1;
}
const soter_key_pair *soter_attk() {
    return &attk;
}
const soter_prop_set *soter_props() {
    return &props;
}

TEE_Result soter_init() {
    TEE_Result res = init_soter_key(&attk);
    if (res == TEE_SUCCESS)
        res = init_soter_prop_set(&props);
    if (res != TEE_SUCCESS) {
        free_soter_key(&attk);
        free_soter_prop_set(&props);
        return res;
    }
    ready_flag = 1;
    return TEE_SUCCESS;
}

TEE_Result soter_check_ready() {
    if (ready_flag == 1)
        return TEE_SUCCESS;
    return soter_init();
}

void soter_deinit() {
    ready_flag = 0;
    free_soter_key(&attk);
    free_soter_prop_set(&props);
}

TEE_Result soter_handle_generate_attk_key_pair(uint32_t, int32_t *result) {
    KM_INFO("this function should not be called in anytime but in meta mode\n");
    if (soter_check_ready() != TEE_SUCCESS) {
        KM_ERR("attk_key_pair is not produced\n");
        *result = KM_ERROR_UNKNOWN_ERROR;
        return TEE_SUCCESS;
    }
    *result = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_verify_attk_key_pair(int32_t *result) {
    soter_key_pair local = {};
    TEE_Result res = TEE_ERROR_OUT_OF_MEMORY;
    for (uint32_t attempt = 0; attempt < kVerifyAttempts && res == TEE_ERROR_OUT_OF_MEMORY; ++attempt)
        res = init_soter_key(&local);
    free_soter_key(&local);
    if (res == TEE_SUCCESS)
        *result = KM_ERROR_OK;
    else if (res == TEE_ERROR_ITEM_NOT_FOUND)
        *result = kVerifyNoKey;
    else
        *result = kVerifyFailed;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_export_attk_public_key(uint8_t *buf, uint32_t *size, int32_t *result) {
    // A NULL reference reaches handlers as an empty one: no room is no buffer.
    if (!buf || *size == 0) {
        KM_ERR("No buffer for the ATTK public key");
        *result = KM_ERROR_INVALID_ARGUMENT;
        return TEE_SUCCESS;
    }
    if (soter_check_ready() != TEE_SUCCESS) {
        KM_ERR("soter is not ready\n");
        *result = kExportNotReady;
        return TEE_SUCCESS;
    }
    uint32_t key_size = 0;
    uint32_t len = 0;
    object_guard key;
    *key.out() = convert_key_to_object(&attk, &key_size);
    TEE_Result res = key.get() ? export_rsa_public_key(key.get(), key_size, buf, *size, &len) : TEE_ERROR_BAD_FORMAT;
    if (res != TEE_SUCCESS) {
        KM_ERR("export attk public key error 0x%x\n", res);
        *result = KM_ERROR_UNKNOWN_ERROR;
        return TEE_SUCCESS;
    }
    *size = len;
    *result = KM_ERROR_OK;
    return TEE_SUCCESS;
}

TEE_Result soter_handle_get_device_id(uint8_t *buf, uint32_t *size, int32_t *result) {
    TEE_Result res = retrieve_orvel_property(kOrvelPropDeviceIdFirst, kOrvelPropDeviceIdSecond, buf, size);
    if (res == TEE_SUCCESS) {
        *result = KM_ERROR_OK;
    } else if (res == TEE_ERROR_SHORT_BUFFER) {
        KM_ERR("device id buffer too small\n");
        *result = KM_ERROR_INSUFFICIENT_BUFFER_SPACE;
    } else {
        KM_ERR("retrieve_device_id_from_orvel fail, 0x%x\n", res);
        *result = KM_ERROR_UNKNOWN_ERROR;
    }
    return TEE_SUCCESS;
}

TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *, const uint8_t *, uint32_t, uint8_t *,
                                    uint32_t *out_len, int32_t *error) {
    KM_ERR("SOTER export is not available in this build");
    *out_len = 0;
    *error = KM_ERROR_UNIMPLEMENTED;
    return TEE_SUCCESS;
}
