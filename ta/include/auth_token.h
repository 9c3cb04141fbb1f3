/*
 * auth_token.h - auth tokens: 69 bytes (version, challenge, user id,
 * authenticator id, authenticator type and timestamp big-endian, then an
 * HMAC-SHA-256 under the boot-seed key), their check and their cache.
 */
#ifndef AUTH_TOKEN_H
#define AUTH_TOKEN_H

#include "keymaster_defs.h"

constexpr uint32_t kAuthTokenSize = 69;
constexpr uint32_t kAuthTokenMacOffset = 37;
constexpr uint32_t kAuthTokenCacheSlots = 16;

/*
 * authorizaiton_init - the auth-token key from the boot seed, the token
 * cache, the use log and the time anchors. TEE_SUCCESS when ready; on
 * failure everything it made is released.
 */
TEE_Result authorizaiton_init();
/* authorization_deinit - releases what authorizaiton_init made. */
void authorization_deinit();

/*
 * ComputeSignature - HMAC-SHA-256 of data under key into out (out_len
 * bytes, 32 expected). TEE_SUCCESS when the MAC was computed; otherwise
 * the failing TEE call's result, and out holds zeros that callers must
 * never use as a MAC.
 */
TEE_Result ComputeSignature(uint8_t *out, uint32_t out_len, TEE_ObjectHandle key, const uint8_t *data,
                            uint32_t data_len);

/*
 * check_auth_token_valid - 0 when the token is well formed and its MAC
 * verifies; 1 otherwise, including when the expected MAC cannot be
 * computed (out of memory, a TEE failure).
 */
uint32_t check_auth_token_valid(const uint8_t *token, uint32_t token_len);

/*
 * check_auth - 0 when the token (or, with a timeout and no token, a fresh
 * cached token) authenticates secure_id for auth_type (and challenge,
 * when not 0); 1 otherwise.
 */
uint32_t check_auth(uint64_t secure_id, uint64_t challenge, const uint8_t *token, const key_param_t *timeout,
                    const key_param_t *auth_type);

/* auth_token_cache_add - keeps a copy of a verified 69-byte token in the first free slot, once. */
void auth_token_cache_add(const uint8_t *token);

#endif
