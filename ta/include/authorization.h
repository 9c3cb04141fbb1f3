/*
 * authorization.h - what a caller must present and satisfy to use a key.
 */
#ifndef AUTHORIZATION_H
#define AUTHORIZATION_H

#include "algorithm_provider.h"
#include "keymaster_defs.h"

/* The deferred-authentication outcome of authorize_begin. */
constexpr int32_t KM_OP_AUTH_NEEDED = 15;

constexpr uint32_t kUseLogEntries = 8;
constexpr uint32_t kKeyIdSize = 2048;

/*
 * use_log_entry_t - uses of one key since the instance started. A key is
 * identified by its blob bytes; a blob longer than key_id holds its
 * SHA-256 instead, with key_id_len the blob's length, so that no long blob
 * can be taken for a short one.
 */
struct use_log_entry_t {
    uint8_t key_id[kKeyIdSize];
    uint32_t key_id_len;
    uint32_t use_count;
    TEE_Time last_use;
    TEE_Time rate_limit_end;
};

/* The use log (kUseLogEntries entries) and time anchors, owned by authorizaiton_init. */
extern use_log_entry_t *use_log;
extern TEE_Time system_time_at_init;
extern TEE_Time ree_time_at_init;

/*
 * check_app_id_and_app_data - 0 when the caller's application id and data
 * (null and 0 when not given) match what the key was bound to; 255
 * otherwise. A key without one of the tags accepts anything for it.
 */
uint32_t check_app_id_and_app_data(const keymaster_key_param_set_t *key_params, const uint8_t *app_id,
                                   uint32_t app_id_len, const uint8_t *app_data, uint32_t app_data_len);

/*
 * authorize_begin - every check on starting an operation. *error is 0
 * (authorized), KM_OP_AUTH_NEEDED (a token is due at every update and
 * finish) or a Keymaster error. Always TEE_SUCCESS.
 */
TEE_Result authorize_begin(const uint8_t *key_id, uint32_t key_id_len, uint32_t purpose,
                           keymaster_key_param_set_t *in_params, const keymaster_key_param_set_t *key_params,
                           int32_t *error);

/* authorize_update_or_finish - per-operation user authentication; always TEE_SUCCESS. */
TEE_Result authorize_update_or_finish(keymaster_key_param_set_t *in_params, const operation_t *op,
                                      uint64_t challenge, int32_t *error);

uint32_t check_use_count_and_add(const uint8_t *key_id, uint32_t key_id_len, uint32_t max_uses, int32_t *error);
uint32_t rate_limit_record(const uint8_t *key_id, uint32_t key_id_len, uint32_t min_seconds);
uint32_t rate_limit_last_use(const uint8_t *key_id, uint32_t key_id_len, TEE_Time *last_use);
void get_wall_time(TEE_Time *time);

#endif
