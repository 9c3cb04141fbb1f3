/*
 * soter.cpp - SOTER attestation. Not built into the TA yet: SOTER keys are
 * refused explicitly rather than exported as plain public keys.
 */
#include "soter.h"

#include "ta_log.h"

TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *, const uint8_t *, uint32_t, uint8_t *,
                                    uint32_t *out_len, int32_t *error) {
    KM_ERR("SOTER export is not available in this build");
    *out_len = 0;
    *error = KM_ERROR_UNIMPLEMENTED;
    return TEE_SUCCESS;
}
