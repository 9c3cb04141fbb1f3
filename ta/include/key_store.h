/*
 * key_store.h - key-store keys (KSKs) and key blobs.
 *
 * Every key leaves the TA as a blob: protection kind (1 byte), 64 bytes of
 * per-blob key derivation input, a 12-byte nonce, a 16-byte tag, and the
 * AES-256-GCM ciphertext of (u32 L, key data, u32 P, parameter set).
 */
#ifndef KEY_STORE_H
#define KEY_STORE_H

#include "keymaster_defs.h"

enum key_protection_t : uint8_t {
    KEY_PROTECTION_DERIVED = 0,
    KEY_PROTECTION_RPMB = 1,
};

// A blob's header: the protection byte, the derivation input, the nonce
// and the tag, each placed right after the one before.
constexpr uint32_t kBlobDeriveSize = 64;
constexpr uint32_t kBlobNonceSize = 12;
constexpr uint32_t kBlobTagSize = 16;
constexpr uint32_t kBlobDeriveOffset = 1;
constexpr uint32_t kBlobNonceOffset = kBlobDeriveOffset + kBlobDeriveSize;
constexpr uint32_t kBlobTagOffset = kBlobNonceOffset + kBlobNonceSize;
constexpr uint32_t kBlobHeaderSize = kBlobTagOffset + kBlobTagSize;
constexpr uint32_t kBlobOverhead = kBlobHeaderSize + 8; // and the two length words
static_assert(kBlobHeaderSize == 93 && kBlobOverhead == 101, "the blob layout is fixed by the interface");

/* The KSKs: null when absent. Read by the blob code. */
extern TEE_ObjectHandle derived_ksk;
extern TEE_ObjectHandle rpmb_ksk;

/*
 * key_store_init - makes the derived KSK and, when RPMB storage is usable,
 * creates or loads the RPMB KSK. TEE_SUCCESS when ready.
 */
TEE_Result key_store_init();
TEE_Result key_store_init_derived_ksk();
bool judge_rpmb();
TEE_Result key_store_init_rpmb_ksk();

/* key_store_deinit - frees both KSK objects (instance teardown). */
void key_store_deinit();

/*
 * TEE_DeriveKK - the per-blob AES-256 key: HMAC-SHA-256 under ksk over the
 * 64 input bytes. On success *kk is a new object the caller frees.
 */
TEE_Result TEE_DeriveKK(TEE_ObjectHandle ksk, const uint8_t *input, TEE_ObjectHandle *kk);

/*
 * save_key - seals key data and params (hidden parameters included) into a
 * blob at blob, whose capacity is *blob_len. On success *blob_len is the
 * blob's size (L + P + 101); on failure 0.
 */
TEE_Result save_key(const uint8_t *key_data, uint32_t key_data_len, const keymaster_key_param_set_t *params,
                    uint8_t *blob, uint32_t *blob_len);

/*
 * open_key - checks and opens a blob. Success is TEE_SUCCESS with *error 0:
 * *key_data (the caller frees it with TEE_Free) and *params (the caller
 * releases it) are set. On failure they are null and empty.
 */
TEE_Result open_key(const uint8_t *blob, uint32_t blob_len, uint8_t **key_data, uint32_t *key_data_len,
                    keymaster_key_param_set_t *params, int32_t *error);

/*
 * open_key_raw - decrypts a blob in place: on success buf starts with the
 * payload and *len is its length (blob length - 93).
 */
TEE_Result open_key_raw(uint8_t *buf, uint32_t *len);

/* key_store_delete_key - nothing is stored per key; refuses blobs under 2 bytes. */
TEE_Result key_store_delete_key(const uint8_t *blob, uint32_t blob_len, int32_t *error);
TEE_Result key_store_delete_all_keys();

#endif
