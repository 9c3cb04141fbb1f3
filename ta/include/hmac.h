/*
 * hmac.h - HMAC keys. Key data: u32 key size in bits, u32 TEE key type,
 * then key size / 8 raw key bytes.
 */
#ifndef HMAC_H
#define HMAC_H

#include "algorithm_provider.h"
#include "keymaster_defs.h"

/*
 * hmac_generate_key / hmac_import_key - the provider's key slots, the HMAC
 * family's secret_generate_key and secret_import_key: the parameters are
 * checked and completed (origin, key size), the key data returned in a
 * buffer the caller frees. Refusals set *error.
 */
extern generate_key_fn &hmac_generate_key;
extern import_key_fn &hmac_import_key;

/*
 * hmac_resolve_key_data - a TEE key object from HMAC key data. On success
 * *object is a new object the caller frees; *key_size (if given) its bits.
 */
TEE_Result hmac_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                 uint32_t *key_size, uint32_t *key_type, int32_t *error);

/* hmac_algorithm_for_key_type - the TEE MAC algorithm of an HMAC key type, or 0. */
uint32_t hmac_algorithm_for_key_type(uint32_t key_type);

/*
 * hmac_operation_t - the record of an HMAC signing or verifying operation:
 * the keyed, initialised MAC operation and its key, the key size and the
 * requested MAC length (bits).
 */
struct hmac_operation_t : keyed_record_t {
    uint32_t key_size;
    uint32_t mac_length;
};
using hmac_sign_operation_t = hmac_operation_t;
using hmac_verify_operation_t = hmac_operation_t;

/*
 * hmac_operation_create - a record of fns's kind holding the key and a
 * keyed, initialised MAC operation; the requested MAC length comes from
 * in_params. Null on failure, with *error set where the failure is the
 * caller's and out_params released.
 */
operation_t *hmac_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                   keymaster_key_param_set_t *out_params, int32_t *error, const operation_fns_t *fns,
                                   const char *func);
/* hmac_operation_update - the update slot of both tables: feeds the whole input to the MAC; nothing is output. Always
 * TEE_SUCCESS. */
update_fn hmac_operation_update;
/*
 * hmac_operation_mac - finishes the MAC into mac (64 bytes); *mac_len its
 * length. A TEE failure is returned; a MAC shorter than the requested
 * length sets *error -1000.
 */
TEE_Result hmac_operation_mac(hmac_operation_t *op, uint8_t *mac, uint32_t *mac_len, int32_t *error, const char *func);
/*
 * hmac_operation_release - the release slot of both HMAC tables: frees
 * the key and the TEE operation, each required of a complete record.
 */
release_fn hmac_operation_release;

/* create_hmac_sign / create_hmac_verify - the create slots of the HMAC sign and verify tables. */
create_operation_fn create_hmac_sign, create_hmac_verify;

#endif
