/*
 * crypto_state.h - what the crypto families keep between calls for the
 * life of one Tee: the algorithms fetched from OpenSSL once, keyed HMAC
 * contexts, and the prepared RSA and EC keys.
 *
 * The Tee creates the state as it starts and frees it, wiping every secret
 * in it, as it ends. Nothing of it lives in a static, so that starting and
 * stopping Tees repeatedly leaves nothing behind and a Tee that is itself
 * a static still ends cleanly at process exit.
 */
#ifndef CRYPTO_STATE_H
#define CRYPTO_STATE_H

#include <array>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <mutex>
#include <vector>

#include <openssl/evp.h>

#include "object_internal.h"

namespace tee_host::detail {

enum class AesMode { Ecb, Cbc, Ctr, Gcm };

using KeyId = SecretBytes;

// key_id - an object type and every attribute of a key, byte for byte (ID,
// then a and b for a value attribute, length and bytes for a buffer one):
// caches compare keys exactly, and copying the bytes costs far less than
// hashing them. Callers keep integer components minimal, so that equal
// keys give equal IDs. The ID holds the key: its allocator wipes it.
KeyId key_id(uint32_t type, const AttributeMap &attrs);

// PreparedKeys - the last few keys turned into EVP_PKEYs, most recently
// used first, keyed by key_id. A key seen again skips OpenSSL's per-key
// set-up (and, for EC, the checks made when the key was first seen).
class PreparedKeys {
  public:
    explicit PreparedKeys(size_t capacity) : capacity_(capacity) {}
    // ~PreparedKeys - frees every key (OpenSSL clears private components
    // as it frees them) and wipes the IDs.
    ~PreparedKeys();
    PreparedKeys(const PreparedKeys &) = delete;
    PreparedKeys &operator=(const PreparedKeys &) = delete;

    // get - a new reference (the caller's) to the key with that ID: the
    // cached one (a hit), or, on a miss, the one `make` returns (its
    // reference passes to the cache, which evicts its least recently used
    // key when full). Null, with nothing kept, when make returns null.
    EVP_PKEY *get(const KeyId &id, const std::function<EVP_PKEY *()> &make);

    // contains - whether a key with that ID is cached (it was checked when
    // it entered); does not count as a use.
    bool contains(const KeyId &id) const;

    PreparedKeyStats stats() const;

  private:
    struct Entry {
        KeyId id;
        EVP_PKEY *pkey;
    };
    static void drop(Entry &e);

    mutable std::mutex mu_;
    std::vector<Entry> entries_;
    size_t capacity_;
    uint64_t hits_ = 0;
    uint64_t misses_ = 0;
};

// KeyedMacs - keyed HMAC contexts by hash and key, so that a key seen again
// (a key-store key on every blob, a key used again) skips the digest lookup
// and the key pads. Used by crypto_mac.cpp; the destructor frees the
// contexts and the allocator wipes the keys.
struct KeyedMacs {
    struct Entry {
        const char *hash;
        SecretBytes key;
        EVP_MAC_CTX *ctx;
    };
    static constexpr size_t kEntries = 8;

    std::mutex mu;
    std::vector<Entry> entries;
    size_t next = 0; // the entry replaced next once all are used

    KeyedMacs() = default;
    ~KeyedMacs();
    KeyedMacs(const KeyedMacs &) = delete;
    KeyedMacs &operator=(const KeyedMacs &) = delete;
};

struct CryptoState {
    EVP_MD *digests[6] = {}; // by GP hash number 1 (MD5) to 6 (SHA-512)
    EVP_MAC *hmac = nullptr;
    EVP_CIPHER *aes[3][4] = {}; // AES-128/192/256 by AesMode
    KeyedMacs macs;
    PreparedKeys rsa_keys{8};
    PreparedKeys ec_keys{8};

    // Fetches everything; panics when OpenSSL lacks an algorithm.
    CryptoState();
    ~CryptoState();
    CryptoState(const CryptoState &) = delete;
    CryptoState &operator=(const CryptoState &) = delete;
};

// crypto_state - the live Tee's state; panics when no Tee is alive.
CryptoState &crypto_state();

// aes_cipher - the fetched cipher for an AES key size in bits and a mode,
// or null for a size AES does not have. The state keeps the reference.
EVP_CIPHER *aes_cipher(uint32_t key_bits, AesMode mode);

// fetched_digest - the fetched hash of GP hash number 1 to 6 (see
// hash_info); the state keeps the reference.
EVP_MD *fetched_digest(uint32_t gp_hash);

} // namespace tee_host::detail

#endif
