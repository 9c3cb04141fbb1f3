/*
 * crypto_digest.cpp - message digests: MD5 and SHA-1/224/256/384/512 on
 * EVP_MD, and the table of GP hash numbers the other families share.
 */
#include "crypto_state.h"
#include "operation_internal.h"

namespace tee_host::detail {
namespace {

constexpr HashInfo kHashes[] = {
    {"MD5", 16, TEE_TYPE_HMAC_MD5},       {"SHA1", 20, TEE_TYPE_HMAC_SHA1},     {"SHA224", 28, TEE_TYPE_HMAC_SHA224},
    {"SHA256", 32, TEE_TYPE_HMAC_SHA256}, {"SHA384", 48, TEE_TYPE_HMAC_SHA384}, {"SHA512", 64, TEE_TYPE_HMAC_SHA512},
};

class DigestEngine final : public Engine {
  public:
    DigestEngine(EVP_MD *md, EVP_MD_CTX *ctx) : md_(md), ctx_(ctx) {}
    ~DigestEngine() override {
        EVP_MD_CTX_free(ctx_);
        EVP_MD_free(md_);
    }
    DigestEngine(const DigestEngine &) = delete;
    DigestEngine &operator=(const DigestEngine &) = delete;

    bool accepts_key(uint32_t) const override { return false; }

    void reset() override {
        if (EVP_DigestInit_ex2(ctx_, md_, nullptr) != 1)
            panic("the digest backend failed to start");
    }

    std::unique_ptr<Engine> clone() const override {
        EVP_MD_CTX *ctx = EVP_MD_CTX_new();
        if (!ctx || EVP_MD_CTX_copy_ex(ctx, ctx_) != 1 || EVP_MD_up_ref(md_) != 1) {
            EVP_MD_CTX_free(ctx);
            panic("the digest backend could not copy an operation");
        }
        return std::make_unique<DigestEngine>(md_, ctx);
    }

    void update(const uint8_t *p, size_t n) {
        if (n && EVP_DigestUpdate(ctx_, p, n) != 1)
            panic("the digest backend failed");
    }

    // final_into - writes the digest (out holds at least the digest size)
    // and starts a fresh one.
    void final_into(uint8_t *out) {
        unsigned int len = 0;
        if (EVP_DigestFinal_ex(ctx_, out, &len) != 1)
            panic("the digest backend failed");
        reset();
    }

  private:
    EVP_MD *md_;
    EVP_MD_CTX *ctx_;
};

DigestEngine &engine(Operation &op) {
    return static_cast<DigestEngine &>(*op.engine);
}

} // namespace

const HashInfo *hash_info(uint32_t gp_hash) {
    if (gp_hash < 1 || gp_hash > 6)
        return nullptr;
    return &kHashes[gp_hash - 1];
}

TEE_Result digest_setup(Operation &op) {
    uint32_t alg = op.info.algorithm;
    if (alg < TEE_ALG_MD5 || alg > TEE_ALG_SHA512 || op.info.mode != TEE_MODE_DIGEST)
        return TEE_ERROR_NOT_SUPPORTED;
    const HashInfo *h = hash_info(alg & 0xF);
    // The engine holds its own reference, so an operation the TA never
    // freed stays usable whatever happens to the Tee's state.
    EVP_MD *md = fetched_digest(alg & 0xF);
    if (EVP_MD_up_ref(md) != 1)
        return TEE_ERROR_OUT_OF_MEMORY;
    EVP_MD_CTX *ctx = EVP_MD_CTX_new();
    if (!ctx || EVP_DigestInit_ex2(ctx, md, nullptr) != 1) {
        EVP_MD_CTX_free(ctx);
        EVP_MD_free(md);
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    op.engine = std::make_unique<DigestEngine>(md, ctx);
    op.info.digestLength = h->size;
    op.info.maxKeySize = 0;
    // A digest needs neither key nor Init.
    op.info.handleState = TEE_HANDLE_FLAG_KEY_SET | TEE_HANDLE_FLAG_INITIALIZED;
    return TEE_SUCCESS;
}

} // namespace tee_host::detail

using namespace tee_host::detail;

extern "C" {

void TEE_DigestUpdate(TEE_OperationHandle operation, const void *chunk, uint32_t chunkSize) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_DIGEST, __func__);
    if (chunkSize && !chunk)
        panic("TEE_DigestUpdate with a null chunk");
    engine(op).update(static_cast<const uint8_t *>(chunk), chunkSize);
    op.active = true;
}

TEE_Result TEE_DigestDoFinal(TEE_OperationHandle operation, const void *chunk, uint32_t chunkLen, void *hash,
                             uint32_t *hashLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_DIGEST, __func__);
    if (chunkLen && !chunk)
        panic("TEE_DigestDoFinal with a null chunk");
    // Nothing is consumed on a short buffer, so the caller can retry.
    if (!output_fits(hashLen, op.info.digestLength, __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if (!hash)
        panic("TEE_DigestDoFinal into a null buffer");
    DigestEngine &e = engine(op);
    e.update(static_cast<const uint8_t *>(chunk), chunkLen);
    e.final_into(static_cast<uint8_t *>(hash));
    *hashLen = op.info.digestLength;
    op.active = false;
    return TEE_SUCCESS;
}

} // extern "C"
