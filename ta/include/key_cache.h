/*
 * key_cache.h - recently opened key blobs, so that a key used again skips
 * its key derivation and decryption.
 *
 * An entry holds a blob's exact bytes and its authenticated plaintext; a
 * lookup hits only on a blob equal in length and in every byte, so no
 * changed, truncated or extended blob can ever be served from it. The
 * entries live in one TA heap block taken when the instance starts; an
 * entry is wiped when it is evicted (least recently used), when its key is
 * deleted, on delete-all and when the instance ends.
 */
#ifndef KEY_CACHE_H
#define KEY_CACHE_H

#include <cstdint>

#include <tee_internal_api.h>

constexpr uint32_t kKeyCacheEntries = 8;
// Blob and plaintext together: an RSA-2048 key fits, larger ones are opened every time.
constexpr uint32_t kKeyCacheEntryBytes = 3072;

/*
 * key_cache_init - takes the cache's block. TEE_ERROR_OUT_OF_MEMORY when
 * the heap cannot hold it (the instance then does not start).
 */
TEE_Result key_cache_init();

/* key_cache_deinit - wipes and frees every entry (instance teardown). */
void key_cache_deinit();

/*
 * key_cache_find - the plaintext cached for exactly these blob bytes:
 * true with *plain (valid until the next key_cache_* call; the cache owns
 * it) and *plain_len, else false.
 */
bool key_cache_find(const uint8_t *blob, uint32_t blob_len, const uint8_t **plain, uint32_t *plain_len);

/*
 * key_cache_put - keeps the authenticated plaintext of a blob, replacing
 * the least recently used entry. Does nothing when the pair is too large
 * or the cache is absent: the cache only ever saves work.
 */
void key_cache_put(const uint8_t *blob, uint32_t blob_len, const uint8_t *plain, uint32_t plain_len);

/* key_cache_forget - wipes the entry of these blob bytes, if any. */
void key_cache_forget(const uint8_t *blob, uint32_t blob_len);

/* key_cache_clear - wipes every entry. */
void key_cache_clear();

#endif
