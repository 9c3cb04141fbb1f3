/*
 * aes.h - AES keys and cipher operations. Key data: u32 key size in bits
 * (128, 192 or 256), then key size / 8 raw key bytes. Import material is
 * the raw key alone.
 */
#ifndef AES_H
#define AES_H

#include "algorithm_provider.h"

constexpr uint32_t kAesBlock = 16;

/*
 * aes_generate_key / aes_import_key - the provider's key slots, the AES
 * family's secret_generate_key and secret_import_key: the parameters are
 * checked and completed (origin, key size), the key data returned in a
 * buffer the caller frees. Refusals set *error; generation reports no
 * memory as TEE_ERROR_OUT_OF_MEMORY, import as error -41.
 */
extern generate_key_fn &aes_generate_key;
extern import_key_fn &aes_import_key;

/*
 * aes_resolve_key_data - a TEE AES key object from key data. On success
 * *object is a new transient object the caller frees and *key_size (if
 * given) its bits; key data too short is TEE_ERROR_GENERIC, and any
 * failure leaves *object null. The size itself is left to the TEE.
 */
resolve_key_data_fn aes_resolve_key_data;

/*
 * aes_encrypt_operation_t / aes_decrypt_operation_t - one layout for both
 * twins: the cipher or AE operation and its key, the begin parameters, the
 * bytes accepted so far and whether payload has started (associated data
 * is refused from then on). Decryption alone holds back data: the GCM
 * candidate tag (mac_length / 8 bytes, tag_fill of them used) and, with
 * PKCS#7, the last decrypted block.
 */
struct aes_operation_t : keyed_record_t {
    uint32_t padding;
    uint32_t block_mode;
    uint32_t key_size;
    uint32_t processed;
    uint32_t mac_length; // bits, GCM only
    uint8_t started;
    uint8_t *tag_buffer;
    uint32_t tag_fill;
    uint8_t *last_block;
};
using aes_encrypt_operation_t = aes_operation_t;
using aes_decrypt_operation_t = aes_operation_t;

/*
 * aes_operation_create - the shared create of both twins: a record of
 * fns's kind for the key data and begin parameters, with a keyed,
 * initialised TEE operation in mode (TEE_MODE_ENCRYPT or _DECRYPT) and,
 * for decryption, its hold-back buffers. The nonce used (given or drawn)
 * is added to out_params as KM_TAG_NONCE except for ECB. Null on failure,
 * with *error set where the failure is the caller's and out_params
 * released.
 */
operation_t *aes_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  keymaster_key_param_set_t *out_params, uint32_t mode, int32_t *error,
                                  const operation_fns_t *fns, const char *func);

/*
 * aes_operation_aad - step 1 of both updates: the single
 * KM_TAG_ASSOCIATED_DATA of in_params, if any, fed to GCM before payload.
 * False with *error -40 when the mode is not GCM or payload has started.
 */
bool aes_operation_aad(aes_operation_t *op, keymaster_key_param_set_t *in_params, int32_t *error, const char *func);

/*
 * aes_cipher_update - one TEE update (cipher or AE by the block mode) of
 * len bytes into out, *out_len the capacity on entry and the bytes written
 * on return. A TEE failure is logged in func's name and returned.
 */
TEE_Result aes_cipher_update(aes_operation_t *op, const uint8_t *in, uint32_t len, uint8_t *out, uint32_t *out_len,
                             const char *func);

/*
 * aes_cipher_final - closes ECB, CBC or CTR, which hold nothing back
 * without padding. A TEE failure is logged and returned; any output is
 * *error -1000.
 */
TEE_Result aes_cipher_final(aes_operation_t *op, int32_t *error, const char *func);

/*
 * aes_operation_release - the release slot of both tables: key object and
 * TEE operation, each required of a complete record, then the decryption
 * buffers when present.
 */
release_fn aes_operation_release;

/* create_aes_encrypt / create_aes_decrypt - the create slots of the AES encrypt and decrypt tables. */
create_operation_fn create_aes_encrypt, create_aes_decrypt;

#endif
