/*
 * crypto_cipher.cpp - AES in ECB and CBC without padding and in CTR mode,
 * on EVP_CIPHER. The platform never pads: a TA that wants padding does it.
 */
#include "crypto_state.h"
#include "operation_internal.h"

namespace tee_host::detail {
namespace {

constexpr size_t kBlock = 16;

class CipherEngine final : public Engine {
  public:
    CipherEngine(AesMode mode, EVP_CIPHER_CTX *ctx) : mode_(mode), block_mode_(mode != AesMode::Ctr), ctx_(ctx) {}
    ~CipherEngine() override {
        EVP_CIPHER_CTX_free(ctx_);
        EVP_CIPHER_free(cipher_);
    }
    CipherEngine(const CipherEngine &) = delete;
    CipherEngine &operator=(const CipherEngine &) = delete;

    bool accepts_key(uint32_t type) const override { return type == TEE_TYPE_AES; }

    void reset() override {
        if (EVP_CIPHER_CTX_reset(ctx_) != 1) // also wipes the key schedule
            panic("the cipher backend failed to reset");
        buffered_ = 0;
    }

    std::unique_ptr<Engine> clone() const override {
        EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
        if (!ctx || EVP_CIPHER_CTX_copy(ctx, ctx_) != 1 || (cipher_ && EVP_CIPHER_up_ref(cipher_) != 1)) {
            EVP_CIPHER_CTX_free(ctx);
            panic("the cipher backend could not copy an operation");
        }
        auto copy = std::make_unique<CipherEngine>(mode_, ctx);
        copy->cipher_ = cipher_;
        copy->buffered_ = buffered_;
        return copy;
    }

    bool block_mode() const { return block_mode_; }

    void init(const SecretBytes &key, const uint8_t *iv, bool encrypt) {
        reset();
        // The Tee fetched the cipher once; the engine holds a reference of
        // its own for as long as its context may use it.
        EVP_CIPHER *wanted = aes_cipher(static_cast<uint32_t>(key.size() * 8), mode_);
        if (wanted != cipher_) {
            if (!wanted || EVP_CIPHER_up_ref(wanted) != 1)
                panic("the cipher backend failed to start");
            EVP_CIPHER_free(cipher_);
            cipher_ = wanted;
        }
        if (EVP_CipherInit_ex2(ctx_, cipher_, key.data(), iv, encrypt ? 1 : 0, nullptr) != 1 ||
            EVP_CIPHER_CTX_set_padding(ctx_, 0) != 1)
            panic("the cipher backend failed to start");
    }

    // in_place_ok - whether input and output may share one address: EVP
    // runs ahead of its input only while it completes a held partial block.
    bool in_place_ok() const { return !block_mode_ || buffered_ == 0; }

    // output_for - the bytes an update of n more input bytes releases.
    size_t output_for(size_t n) const { return block_mode_ ? (buffered_ + n) / kBlock * kBlock : n; }
    size_t buffered() const { return buffered_; }

    void update(const uint8_t *in, size_t n, uint8_t *out, size_t expected) {
        size_t written = 0;
        if (!cipher_update(ctx_, out, in, n, &written) || written != expected)
            panic("the cipher backend failed");
        if (block_mode_)
            buffered_ = (buffered_ + n) % kBlock;
    }

    // finish_stream - closes the EVP computation, which without padding
    // has nothing left to release.
    void finish_stream() {
        uint8_t tail[2 * kBlock] = {};
        int outl = 0;
        if (EVP_CipherFinal_ex(ctx_, tail, &outl) != 1 || outl != 0)
            panic("the cipher backend failed to finish");
    }

  private:
    AesMode mode_;
    bool block_mode_;
    EVP_CIPHER_CTX *ctx_;
    EVP_CIPHER *cipher_ = nullptr;
    size_t buffered_ = 0; // input bytes EVP holds until a block is complete
};

CipherEngine &engine(Operation &op) {
    return static_cast<CipherEngine &>(*op.engine);
}

} // namespace

TEE_Result cipher_setup(Operation &op) {
    AesMode mode = AesMode::Ecb;
    switch (op.info.algorithm) {
    case TEE_ALG_AES_ECB_NOPAD:
        break;
    case TEE_ALG_AES_CBC_NOPAD:
        mode = AesMode::Cbc;
        break;
    case TEE_ALG_AES_CTR:
        mode = AesMode::Ctr;
        break;
    default:
        return TEE_ERROR_NOT_SUPPORTED;
    }
    if (op.info.mode != TEE_MODE_ENCRYPT && op.info.mode != TEE_MODE_DECRYPT)
        return TEE_ERROR_NOT_SUPPORTED;
    if (!secret_object_type(TEE_TYPE_AES)->size_ok(op.info.maxKeySize))
        return TEE_ERROR_NOT_SUPPORTED;
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    if (!ctx)
        return TEE_ERROR_OUT_OF_MEMORY;
    op.engine = std::make_unique<CipherEngine>(mode, ctx);
    op.info.requiredKeyUsage = op.info.mode == TEE_MODE_ENCRYPT ? TEE_USAGE_ENCRYPT : TEE_USAGE_DECRYPT;
    return TEE_SUCCESS;
}

} // namespace tee_host::detail

using namespace tee_host::detail;

extern "C" {

void TEE_CipherInit(TEE_OperationHandle operation, const void *IV, uint32_t IVLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_CIPHER, __func__);
    require_key(op, __func__);
    CipherEngine &e = engine(op);
    const uint8_t *iv = nullptr;
    if (op.info.algorithm != TEE_ALG_AES_ECB_NOPAD) { // ECB ignores any IV
        if (IVLen != kBlock || !IV)
            panic("TEE_CipherInit without a 16-byte IV");
        iv = static_cast<const uint8_t *>(IV);
    }
    e.init(secret_value(op), iv, op.info.mode == TEE_MODE_ENCRYPT);
    begin(op);
}

TEE_Result TEE_CipherUpdate(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                            uint32_t *destLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_CIPHER, __func__);
    require_initialized(op, __func__);
    CipherEngine &e = engine(op);
    size_t needed = e.output_for(srcLen);
    if (!output_fits(destLen, needed, __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if (needed && !destData)
        panic("TEE_CipherUpdate into a null buffer");
    InputView in(srcData, srcLen, destData, *destLen, __func__, e.in_place_ok());
    e.update(in.data(), in.size(), static_cast<uint8_t *>(destData), needed);
    *destLen = static_cast<uint32_t>(needed);
    return TEE_SUCCESS;
}

TEE_Result TEE_CipherDoFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                             uint32_t *destLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_CIPHER, __func__);
    require_initialized(op, __func__);
    CipherEngine &e = engine(op);
    if (e.block_mode() && (e.buffered() + srcLen) % kBlock != 0) {
        // Without padding a partial last block cannot be processed; the
        // computation is over.
        finish(op);
        return TEE_ERROR_BAD_PARAMETERS;
    }
    size_t needed = e.output_for(srcLen);
    if (!output_fits(destLen, needed, __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if (needed && !destData)
        panic("TEE_CipherDoFinal into a null buffer");
    InputView in(srcData, srcLen, destData, *destLen, __func__, e.in_place_ok());
    e.update(in.data(), in.size(), static_cast<uint8_t *>(destData), needed);
    e.finish_stream();
    *destLen = static_cast<uint32_t>(needed);
    finish(op);
    return TEE_SUCCESS;
}

} // extern "C"
