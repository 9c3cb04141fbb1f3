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

/*
 * use_log_init - allocates the zeroed use log of kUseLogEntries entries;
 * TEE_ERROR_OUT_OF_MEMORY (logged) when the heap is exhausted.
 * use_log_release wipes and frees it. Both belong to authorizaiton_init
 * and authorization_deinit.
 */
TEE_Result use_log_init();
/* use_log_release - see use_log_init. */
void use_log_release();
/* time_anchors_init - records the TEE system time and REE time that get_wall_time starts from. */
void time_anchors_init();

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

/*
 * authorize_update_or_finish - per-operation user authentication of op's
 * key with the handle as challenge: *error 0, -38 (bad token or key
 * configuration) or -26 (not authenticated). Always TEE_SUCCESS.
 */
TEE_Result authorize_update_or_finish(keymaster_key_param_set_t *in_params, const operation_t *op, uint64_t challenge,
                                      int32_t *error);

/*
 * check_use_count_and_add - counts one use of the key against max_uses: 0
 * when allowed and counted; 1 with *error set when the key is used up
 * (-56), the use log has no room for it (-31) or the key cannot be
 * identified (-41).
 */
uint32_t check_use_count_and_add(const uint8_t *key_id, uint32_t key_id_len, uint32_t max_uses, int32_t *error);
/*
 * rate_limit_record - stamps the key's last use now and its window's end
 * min_seconds later; 0 when stamped, 1 when the use log has no room or the
 * key cannot be identified.
 */
uint32_t rate_limit_record(const uint8_t *key_id, uint32_t key_id_len, uint32_t min_seconds);
/* rate_limit_last_use's answer when the key could not be identified: the caller must refuse. */
constexpr uint32_t kRateLimitUnknown = 2;
/*
 * rate_limit_last_use - 0 and *last_use when the key's use was stamped, 1
 * when it never was (no entry, or only a use count), kRateLimitUnknown when
 * its identifier could not be computed.
 */
uint32_t rate_limit_last_use(const uint8_t *key_id, uint32_t key_id_len, TEE_Time *last_use);
/* get_wall_time - the REE time at start advanced by the TEE system time elapsed since. */
void get_wall_time(TEE_Time *time);

#endif
