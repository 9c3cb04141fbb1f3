/*
 * key_cache.cpp - recently opened key blobs, compared byte for byte.
 */
#include "key_cache.h"

#include "byte_io.h"
#include "key_store.h"
#include "ta_heap.h"

namespace {

struct key_cache_entry_t {
    uint32_t blob_len; // 0: empty
    uint32_t plain_len;
    uint64_t last_use;
    uint8_t bytes[kKeyCacheEntryBytes]; // the blob, then its plaintext
};

key_cache_entry_t *entries = nullptr;
uint64_t use_clock = 0;

void wipe(key_cache_entry_t *e) {
    TEE_MemFill(e, 0, sizeof *e);
}

key_cache_entry_t *find_entry(const uint8_t *blob, uint32_t blob_len) {
    if (!entries || blob_len == 0)
        return nullptr;
    for (uint32_t i = 0; i < kKeyCacheEntries; ++i) {
        key_cache_entry_t *e = &entries[i];
        // The tag differs between any two blobs of one KSK: a cheap first test.
        if (e->blob_len == blob_len && blob_len > kBlobTagOffset && e->bytes[kBlobTagOffset] == blob[kBlobTagOffset] &&
            bytes_equal_ct(e->bytes, blob, blob_len))
            return e;
    }
    return nullptr;
}

} // namespace

TEE_Result key_cache_init() {
    key_cache_deinit();
    entries = static_cast<key_cache_entry_t *>(ta_malloc(kKeyCacheEntries * sizeof(key_cache_entry_t)));
    return entries ? TEE_SUCCESS : TEE_ERROR_OUT_OF_MEMORY;
}

void key_cache_deinit() {
    ta_free_wiped(entries, kKeyCacheEntries * sizeof(key_cache_entry_t));
    entries = nullptr;
    use_clock = 0;
}

bool key_cache_find(const uint8_t *blob, uint32_t blob_len, const uint8_t **plain, uint32_t *plain_len) {
    key_cache_entry_t *e = find_entry(blob, blob_len);
    if (!e)
        return false;
    e->last_use = ++use_clock;
    *plain = e->bytes + e->blob_len;
    *plain_len = e->plain_len;
    return true;
}

void key_cache_put(const uint8_t *blob, uint32_t blob_len, const uint8_t *plain, uint32_t plain_len) {
    if (!entries || blob_len == 0 || blob_len > kKeyCacheEntryBytes || plain_len > kKeyCacheEntryBytes - blob_len)
        return;
    key_cache_entry_t *slot = find_entry(blob, blob_len);
    for (uint32_t i = 0; !slot && i < kKeyCacheEntries; ++i) {
        if (entries[i].blob_len == 0)
            slot = &entries[i];
    }
    if (!slot) {
        slot = &entries[0];
        for (uint32_t i = 1; i < kKeyCacheEntries; ++i) {
            if (entries[i].last_use < slot->last_use)
                slot = &entries[i];
        }
    }
    wipe(slot);
    TEE_MemMove(slot->bytes, blob, blob_len);
    TEE_MemMove(slot->bytes + blob_len, plain, plain_len);
    slot->blob_len = blob_len;
    slot->plain_len = plain_len;
    slot->last_use = ++use_clock;
}

void key_cache_forget(const uint8_t *blob, uint32_t blob_len) {
    if (key_cache_entry_t *e = find_entry(blob, blob_len))
        wipe(e);
}

void key_cache_clear() {
    if (entries)
        TEE_MemFill(entries, 0, kKeyCacheEntries * sizeof(key_cache_entry_t));
}
