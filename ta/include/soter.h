/*
 * soter.h - SOTER attestation: the process-wide SOTER state (the ATTK and
 * the SOTER property set, loaded lazily from the provisioning TA), the
 * SOTER commands 0xFF00 to 0xFF03, and the SOTER export of a key.
 */
#ifndef SOTER_H
#define SOTER_H

#include "keymaster_defs.h"
#include "soter_key.h"

/*
 * soter_check_ready - 0 when the SOTER state is loaded; otherwise loads it
 * now (soter_init) and returns that result. A failed load leaves nothing
 * loaded, so the next call tries again.
 */
TEE_Result soter_check_ready();

/* soter_init - loads the ATTK then the property set; on failure both are released and the state stays unloaded. */
TEE_Result soter_init();

/* soter_deinit - marks the state unloaded and releases (wipes) both records. */
void soter_deinit();

/* soter_is_ready - whether the SOTER state is loaded. */
bool soter_is_ready();

/* soter_attk, soter_props - the loaded records, owned by the SOTER state; meaningful only while ready. */
const soter_key_pair *soter_attk();
const soter_prop_set *soter_props();

/*
 * The SOTER command handlers. Each returns TEE_SUCCESS and reports its own
 * outcome in *result:
 * - generate (0xFF00): 0 loaded, -1000 not loaded;
 * - verify (0xFF01): 0 the provisioning TA's key loads, -1 it has none,
 *   -2 any other failure (out-of-memory retried, three attempts in all);
 *   the loaded state is not touched;
 * - export (0xFF02): the ATTK's public key as PEM into buf, *size the
 *   capacity in and the length counting its NUL out; 0, -38 no buffer,
 *   -1 SOTER not ready, -1000 conversion or export failed (size unchanged);
 * - device id (0xFF03): the device identifier into buf; 0, -29 buffer too
 *   small (size unchanged), -1000 other failure.
 */
TEE_Result soter_handle_generate_attk_key_pair(uint32_t unused, int32_t *result);
TEE_Result soter_handle_verify_attk_key_pair(int32_t *result);
TEE_Result soter_handle_export_attk_public_key(uint8_t *buf, uint32_t *size, int32_t *result);
TEE_Result soter_handle_get_device_id(uint8_t *buf, uint32_t *size, int32_t *result);

/*
 * soter_enhance_export_key - the export of a key marked as a SOTER key.
 * Until SOTER documents are built into this TA it refuses with
 * KM_ERROR_UNIMPLEMENTED.
 */
TEE_Result soter_enhance_export_key(const keymaster_key_param_set_t *key_params, const uint8_t *key_data,
                                    uint32_t key_data_len, uint8_t *out, uint32_t *out_len, int32_t *error);

#endif
