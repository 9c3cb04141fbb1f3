/*
 * crypto_state.cpp - the crypto state a Tee owns: fetched algorithms, the
 * keyed-MAC and prepared-key caches, and the key IDs behind the latter.
 */
#include "crypto_state.h"

#include <algorithm>

#include <openssl/crypto.h>

#include "operation_internal.h"

namespace tee_host {
namespace detail {
namespace {

const char *const kAesNames[3][4] = {
    {"AES-128-ECB", "AES-128-CBC", "AES-128-CTR", "AES-128-GCM"},
    {"AES-192-ECB", "AES-192-CBC", "AES-192-CTR", "AES-192-GCM"},
    {"AES-256-ECB", "AES-256-CBC", "AES-256-CTR", "AES-256-GCM"},
};

} // namespace

// --- Key IDs ---------------------------------------------------------------------

KeyId key_id(uint32_t type, const AttributeMap &attrs) {
    KeyId out;
    auto add_u32 = [&out](uint32_t v) {
        const uint8_t b[4] = {static_cast<uint8_t>(v >> 24), static_cast<uint8_t>(v >> 16),
                              static_cast<uint8_t>(v >> 8), static_cast<uint8_t>(v)};
        out.insert(out.end(), b, b + sizeof b);
    };
    size_t total = 4;
    for (const auto &[id, attr] : attrs)
        total += 12 + attr.bytes.size();
    out.reserve(total);
    add_u32(type);
    for (const auto &[id, attr] : attrs) {
        add_u32(id);
        if (is_value_attribute(id)) {
            add_u32(attr.a);
            add_u32(attr.b);
        } else {
            add_u32(static_cast<uint32_t>(attr.bytes.size()));
            out.insert(out.end(), attr.bytes.begin(), attr.bytes.end());
        }
    }
    return out;
}

// --- Prepared keys ----------------------------------------------------------------

namespace {
bool same_id(const KeyId &a, const KeyId &b) {
    return a.size() == b.size() && CRYPTO_memcmp(a.data(), b.data(), a.size()) == 0;
}
} // namespace

void PreparedKeys::drop(Entry &e) {
    EVP_PKEY_free(e.pkey);
    e.pkey = nullptr;
    OPENSSL_cleanse(e.id.data(), e.id.size());
}

PreparedKeys::~PreparedKeys() {
    for (Entry &e : entries_)
        drop(e);
}

EVP_PKEY *PreparedKeys::get(const KeyId &id, const std::function<EVP_PKEY *()> &make) {
    std::lock_guard<std::mutex> lock(mu_);
    auto it = std::find_if(entries_.begin(), entries_.end(), [&](const Entry &e) { return same_id(e.id, id); });
    if (it != entries_.end()) {
        ++hits_;
        std::rotate(entries_.begin(), it, it + 1);
    } else {
        // Made under the lock, so that two threads never prepare one key twice.
        EVP_PKEY *pkey = make();
        if (!pkey)
            return nullptr;
        ++misses_;
        if (entries_.size() == capacity_) {
            drop(entries_.back());
            entries_.pop_back();
        }
        entries_.insert(entries_.begin(), Entry{id, pkey});
    }
    EVP_PKEY *pkey = entries_.front().pkey;
    if (EVP_PKEY_up_ref(pkey) != 1)
        panic("the crypto backend failed");
    return pkey;
}

bool PreparedKeys::contains(const KeyId &id) const {
    std::lock_guard<std::mutex> lock(mu_);
    return std::any_of(entries_.begin(), entries_.end(), [&](const Entry &e) { return same_id(e.id, id); });
}

PreparedKeyStats PreparedKeys::stats() const {
    std::lock_guard<std::mutex> lock(mu_);
    return PreparedKeyStats{hits_, misses_, entries_.size()};
}

// --- The state ---------------------------------------------------------------------

KeyedMacs::~KeyedMacs() {
    for (Entry &e : entries)
        EVP_MAC_CTX_free(e.ctx);
}

CryptoState::CryptoState() {
    bool ok = true;
    for (uint32_t i = 0; i < 6; ++i)
        ok = ok && (digests[i] = EVP_MD_fetch(nullptr, hash_info(i + 1)->name, nullptr));
    ok = ok && (hmac = EVP_MAC_fetch(nullptr, "HMAC", nullptr));
    for (size_t size = 0; size < 3; ++size)
        for (size_t mode = 0; mode < 4; ++mode)
            ok = ok && (aes[size][mode] = EVP_CIPHER_fetch(nullptr, kAesNames[size][mode], nullptr));
    if (!ok)
        panic("the crypto backend lacks an algorithm the TEE offers");
}

CryptoState::~CryptoState() {
    for (EVP_MD *md : digests)
        EVP_MD_free(md);
    EVP_MAC_free(hmac);
    for (auto &row : aes)
        for (EVP_CIPHER *c : row)
            EVP_CIPHER_free(c);
}

void CryptoStateDelete::operator()(CryptoState *s) const {
    delete s;
}

CryptoStatePtr start_crypto() {
    return CryptoStatePtr(new CryptoState);
}

CryptoState &crypto_state() {
    return *globals().crypto;
}

EVP_CIPHER *aes_cipher(uint32_t key_bits, AesMode mode) {
    int row = key_bits == 128 ? 0 : key_bits == 192 ? 1 : key_bits == 256 ? 2 : -1;
    if (row < 0)
        return nullptr;
    return crypto_state().aes[row][static_cast<size_t>(mode)];
}

EVP_MD *fetched_digest(uint32_t gp_hash) {
    if (!hash_info(gp_hash))
        panic("an unknown hash");
    return crypto_state().digests[gp_hash - 1];
}

} // namespace detail

// With no Tee alive there is no cache, and so nothing in it.
namespace rsa_cache {
Stats stats() {
    Tee *tee = Tee::current();
    return tee ? tee->impl_for_detail().crypto->rsa_keys.stats() : Stats{};
}
} // namespace rsa_cache

namespace ec_cache {
Stats stats() {
    Tee *tee = Tee::current();
    return tee ? tee->impl_for_detail().crypto->ec_keys.stats() : Stats{};
}
} // namespace ec_cache

} // namespace tee_host
