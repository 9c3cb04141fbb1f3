/*
 * hmac.h - HMAC keys. Key data: u32 key size in bits, u32 TEE key type,
 * then key size / 8 raw key bytes.
 */
#ifndef HMAC_H
#define HMAC_H

#include "algorithm_provider.h"
#include "keymaster_defs.h"

TEE_Result hmac_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                             int32_t *error);
TEE_Result hmac_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                           uint8_t **key_data, uint32_t *key_data_len, int32_t *error);

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
struct hmac_operation_t {
    operation_t header;
    TEE_OperationHandle operation;
    TEE_ObjectHandle key;
    uint32_t key_size;
    uint32_t mac_length;
};
using hmac_sign_operation_t = hmac_operation_t;
using hmac_verify_operation_t = hmac_operation_t;


/* hmac_operation_create - builds a keyed MAC operation record; null with *error on failure. */
operation_t *hmac_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                   keymaster_key_param_set_t *out_params, int32_t *error,
                                   const operation_fns_t *fns, const char *func);
/* hmac_operation_update - feeds the whole input to the MAC. */
TEE_Result hmac_operation_update(operation_t *op, const uint8_t *input, uint32_t *input_len, uint32_t *output_len,
                                 int32_t *error);
/* hmac_operation_mac - finishes the MAC into mac (64 bytes); *mac_len its length. */
TEE_Result hmac_operation_mac(hmac_operation_t *op, uint8_t *mac, uint32_t *mac_len, int32_t *error,
                              const char *func);
/* hmac_operation_free - releases the record, its key and its TEE operation. */
void hmac_operation_free(operation_t *op, const char *record_name, const char *func);

operation_t *create_hmac_sign(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *key_params,
                              keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                              int32_t *error);
operation_t *create_hmac_verify(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *key_params,
                                keymaster_key_param_set_t *in_params, keymaster_key_param_set_t *out_params,
                                int32_t *error);

#endif
