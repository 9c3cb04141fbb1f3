/*
 * soter.h - SOTER attestation entry points used by the key commands.
 */
#ifndef SOTER_H
#define SOTER_H

#include "keymaster_defs.h"

/*
 * soter_enhance_export_key - the export of a key marked as a SOTER key.
 * Until SOTER attestation is built into this TA it refuses with
 * KM_ERROR_UNIMPLEMENTED.
 */
TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *key_params, const uint8_t *key_data,
                                    uint32_t key_data_len, uint8_t *out, uint32_t *out_len, int32_t *error);

#endif
