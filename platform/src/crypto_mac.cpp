/*
 * crypto_mac.cpp - HMAC over MD5 and SHA-1/224/256/384/512 on EVP_MAC.
 */
#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/params.h>

#include "crypto_state.h"
#include "operation_internal.h"

namespace tee_host::detail {
namespace {

// keyed_ctx - a new HMAC context keyed with `key` for `hash`, duplicated
// from the Tee's keyed contexts when this key was seen lately.
EVP_MAC_CTX *keyed_ctx(const char *hash, const SecretBytes &key) {
    CryptoState &state = crypto_state();
    KeyedMacs &c = state.macs;
    {
        std::lock_guard<std::mutex> lock(c.mu);
        for (auto &e : c.entries)
            if (e.hash == hash && e.key.size() == key.size() &&
                CRYPTO_memcmp(e.key.data(), key.data(), key.size()) == 0)
                return EVP_MAC_CTX_dup(e.ctx);
    }
    OSSL_PARAM params[] = {
        OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, const_cast<char *>(hash), 0),
        OSSL_PARAM_construct_end(),
    };
    EVP_MAC_CTX *ctx = EVP_MAC_CTX_new(state.hmac);
    if (!ctx || EVP_MAC_init(ctx, key.data(), key.size(), params) != 1)
        panic("the MAC backend failed to start");
    EVP_MAC_CTX *tmpl = EVP_MAC_CTX_dup(ctx);
    if (!tmpl)
        return ctx; // not kept; the next use keys again
    std::lock_guard<std::mutex> lock(c.mu);
    if (c.entries.size() < KeyedMacs::kEntries) {
        c.entries.push_back({hash, key, tmpl});
    } else {
        auto &e = c.entries[c.next++ % KeyedMacs::kEntries];
        EVP_MAC_CTX_free(e.ctx);
        e = {hash, key, tmpl};
    }
    return ctx;
}

// The widest key any HMAC operation takes: that of a generic secret.
constexpr uint32_t kMaxGenericBits = 4096;

class MacEngine final : public Engine {
  public:
    MacEngine(const HashInfo &hash, EVP_MAC *mac) : hash_(hash), mac_(mac) {}
    ~MacEngine() override {
        EVP_MAC_CTX_free(ctx_);
        EVP_MAC_free(mac_);
    }
    MacEngine(const MacEngine &) = delete;
    MacEngine &operator=(const MacEngine &) = delete;

    bool accepts_key(uint32_t type) const override {
        return type == hash_.hmac_type || type == TEE_TYPE_GENERIC_SECRET;
    }

    // The context holds the keyed state, so it goes rather than lingers.
    // The keyed context outlives a computation: re-initialising it without
    // a key drops the message state and keeps the pads.
    void reset() override {
        if (ctx_ && EVP_MAC_init(ctx_, nullptr, 0, nullptr) != 1)
            panic("the MAC backend failed to reset");
    }
    void rekey() override {
        EVP_MAC_CTX_free(ctx_);
        ctx_ = nullptr;
    }

    std::unique_ptr<Engine> clone() const override {
        if (EVP_MAC_up_ref(mac_) != 1)
            panic("the MAC backend could not copy an operation");
        auto copy = std::make_unique<MacEngine>(hash_, mac_);
        if (ctx_ && !(copy->ctx_ = EVP_MAC_CTX_dup(ctx_)))
            panic("the MAC backend could not copy an operation");
        return copy;
    }

    void init(const SecretBytes &key) {
        if (!ctx_)
            ctx_ = keyed_ctx(hash_.name, key);
        if (!ctx_ || EVP_MAC_init(ctx_, nullptr, 0, nullptr) != 1)
            panic("the MAC backend failed to start");
    }

    void update(const void *p, size_t n) {
        if (n && EVP_MAC_update(ctx_, static_cast<const unsigned char *>(p), n) != 1)
            panic("the MAC backend failed");
    }

    // final_into - writes the MAC; out holds at least size() bytes.
    void final_into(uint8_t *out) {
        size_t len = 0;
        if (EVP_MAC_final(ctx_, out, &len, hash_.size) != 1 || len != hash_.size)
            panic("the MAC backend failed");
    }

    uint32_t size() const { return hash_.size; }

  private:
    const HashInfo &hash_;
    EVP_MAC *mac_;
    EVP_MAC_CTX *ctx_ = nullptr;
};

MacEngine &engine(Operation &op) {
    return static_cast<MacEngine &>(*op.engine);
}

// The message part of a final call, then the MAC itself.
void finish_mac(Operation &op, const void *message, uint32_t messageLen, uint8_t *out, const char *fn) {
    require_initialized(op, fn);
    if (messageLen && !message)
        panic("a MAC final call with a null message");
    MacEngine &e = engine(op);
    e.update(message, messageLen);
    e.final_into(out);
}

} // namespace

TEE_Result mac_setup(Operation &op) {
    uint32_t alg = op.info.algorithm;
    if (alg < TEE_ALG_HMAC_MD5 || alg > TEE_ALG_HMAC_SHA512 || op.info.mode != TEE_MODE_MAC)
        return TEE_ERROR_NOT_SUPPORTED;
    const HashInfo *h = hash_info(alg & 0xF);
    // A generic secret may key any HMAC, so its sizes are acceptable too.
    uint32_t max = op.info.maxKeySize;
    if (!secret_object_type(h->hmac_type)->size_ok(max) && !(max >= 8 && max <= kMaxGenericBits && max % 8 == 0))
        return TEE_ERROR_NOT_SUPPORTED;
    EVP_MAC *mac = crypto_state().hmac;
    if (EVP_MAC_up_ref(mac) != 1)
        return TEE_ERROR_OUT_OF_MEMORY;
    op.engine = std::make_unique<MacEngine>(*h, mac);
    op.info.digestLength = h->size;
    op.info.requiredKeyUsage = TEE_USAGE_MAC;
    return TEE_SUCCESS;
}

} // namespace tee_host::detail

using namespace tee_host::detail;

extern "C" {

void TEE_MACInit(TEE_OperationHandle operation, const void *, uint32_t) {
    // HMAC takes no IV; GP lets the caller pass one and have it ignored.
    Operation &op = operation_from_handle(operation, TEE_OPERATION_MAC, __func__);
    require_key(op, __func__);
    engine(op).init(secret_value(op));
    begin(op);
}

void TEE_MACUpdate(TEE_OperationHandle operation, const void *chunk, uint32_t chunkSize) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_MAC, __func__);
    require_initialized(op, __func__);
    if (chunkSize && !chunk)
        panic("TEE_MACUpdate with a null chunk");
    engine(op).update(chunk, chunkSize);
}

TEE_Result TEE_MACComputeFinal(TEE_OperationHandle operation, const void *message, uint32_t messageLen, void *mac,
                               uint32_t *macLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_MAC, __func__);
    require_initialized(op, __func__);
    // Checked before consuming the message, so a retry sees the same state.
    if (!output_fits(macLen, engine(op).size(), __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if (!mac)
        panic("TEE_MACComputeFinal into a null buffer");
    finish_mac(op, message, messageLen, static_cast<uint8_t *>(mac), __func__);
    *macLen = engine(op).size();
    finish(op);
    return TEE_SUCCESS;
}

TEE_Result TEE_MACCompareFinal(TEE_OperationHandle operation, const void *message, uint32_t messageLen, const void *mac,
                               uint32_t macLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_MAC, __func__);
    if (macLen && !mac)
        panic("TEE_MACCompareFinal with a null MAC");
    uint8_t computed[EVP_MAX_MD_SIZE] = {};
    finish_mac(op, message, messageLen, computed, __func__);
    uint32_t size = engine(op).size();
    bool same = macLen == size && CRYPTO_memcmp(computed, mac, size) == 0;
    OPENSSL_cleanse(computed, sizeof computed);
    finish(op);
    return same ? TEE_SUCCESS : TEE_ERROR_MAC_INVALID;
}

} // extern "C"
