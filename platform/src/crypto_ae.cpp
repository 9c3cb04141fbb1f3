/*
 * crypto_ae.cpp - AES-GCM authenticated encryption on EVP_CIPHER.
 *
 * GCM is a stream: each update releases as many bytes as it takes. When
 * decrypting, the final chunk is decrypted aside and released only once
 * the tag has been checked.
 */
#include <algorithm>

#include <openssl/core_names.h>
#include <openssl/params.h>

#include "crypto_state.h"
#include "operation_internal.h"

namespace tee_host::detail {
namespace {

// The tag lengths GP gives GCM: 96 to 128 bits in whole bytes.
constexpr uint32_t kMinTagBits = 96;
constexpr uint32_t kMaxTagBits = 128;
constexpr uint32_t kMaxNonce = 128;  // the backend's limit
constexpr size_t kDefaultNonce = 12; // GCM's own; no length to announce

class AeEngine final : public Engine {
  public:
    explicit AeEngine(EVP_CIPHER_CTX *ctx) : ctx_(ctx) {}
    ~AeEngine() override {
        EVP_CIPHER_CTX_free(ctx_);
        EVP_CIPHER_free(cipher_);
    }
    AeEngine(const AeEngine &) = delete;
    AeEngine &operator=(const AeEngine &) = delete;

    bool accepts_key(uint32_t type) const override { return type == TEE_TYPE_AES; }

    void reset() override {
        if (EVP_CIPHER_CTX_reset(ctx_) != 1)
            panic("the AE backend failed to reset");
        tag_len_ = 0;
        payload_started_ = false;
    }

    std::unique_ptr<Engine> clone() const override {
        EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
        if (!ctx || EVP_CIPHER_CTX_copy(ctx, ctx_) != 1 || (cipher_ && EVP_CIPHER_up_ref(cipher_) != 1)) {
            EVP_CIPHER_CTX_free(ctx);
            panic("the AE backend could not copy an operation");
        }
        auto copy = std::make_unique<AeEngine>(ctx);
        copy->cipher_ = cipher_;
        copy->tag_len_ = tag_len_;
        copy->payload_started_ = payload_started_;
        return copy;
    }

    void init(const SecretBytes &key, const uint8_t *nonce, size_t nonce_len, size_t tag_len, bool encrypt) {
        reset();
        // The Tee fetched the cipher once; the engine holds a reference of
        // its own for as long as its context may use it.
        EVP_CIPHER *wanted = aes_cipher(static_cast<uint32_t>(key.size() * 8), AesMode::Gcm);
        if (wanted != cipher_) {
            if (!wanted || EVP_CIPHER_up_ref(wanted) != 1)
                panic("the AE backend failed to start");
            EVP_CIPHER_free(cipher_);
            cipher_ = wanted;
        }
        int enc = encrypt ? 1 : 0;
        bool ok = true;
        if (nonce_len == kDefaultNonce) {
            ok = EVP_CipherInit_ex2(ctx_, cipher_, key.data(), nonce, enc, nullptr) == 1;
        } else {
            // Another nonce length must be known before the nonce is given.
            size_t iv_len = nonce_len;
            OSSL_PARAM params[] = {OSSL_PARAM_construct_size_t(OSSL_CIPHER_PARAM_AEAD_IVLEN, &iv_len),
                                   OSSL_PARAM_construct_end()};
            ok = EVP_CipherInit_ex2(ctx_, cipher_, nullptr, nullptr, enc, nullptr) == 1 &&
                 EVP_CIPHER_CTX_set_params(ctx_, params) == 1 &&
                 EVP_CipherInit_ex2(ctx_, nullptr, key.data(), nonce, enc, nullptr) == 1;
        }
        if (!ok)
            panic("the AE backend failed to start");
        tag_len_ = tag_len;
    }

    void aad(const uint8_t *p, size_t n) {
        if (payload_started_)
            panic("TEE_AEUpdateAAD after payload data");
        size_t written = 0;
        if (!cipher_update(ctx_, nullptr, p, n, &written))
            panic("the AE backend failed");
    }

    void update(const uint8_t *in, size_t n, uint8_t *out) {
        size_t written = 0;
        if (!cipher_update(ctx_, out, in, n, &written) || written != n)
            panic("the AE backend failed");
        payload_started_ = true;
    }

    void encrypt_final(uint8_t *tag) {
        uint8_t tail[16] = {};
        int outl = 0;
        OSSL_PARAM params[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, tag, tag_len_),
                               OSSL_PARAM_construct_end()};
        if (EVP_CipherFinal_ex(ctx_, tail, &outl) != 1 || outl != 0 || EVP_CIPHER_CTX_get_params(ctx_, params) != 1)
            panic("the AE backend failed to finish");
    }

    // decrypt_final - the last chunk into out and the tag check; false
    // when the tag does not match.
    bool decrypt_final(const uint8_t *in, size_t n, uint8_t *out, const uint8_t *tag) {
        OSSL_PARAM params[] = {
            OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, const_cast<uint8_t *>(tag), tag_len_),
            OSSL_PARAM_construct_end()};
        if (EVP_CIPHER_CTX_set_params(ctx_, params) != 1)
            panic("the AE backend refused the tag");
        update(in, n, out);
        uint8_t tail[16] = {};
        int outl = 0;
        return EVP_CipherFinal_ex(ctx_, tail, &outl) == 1 && outl == 0;
    }

    size_t tag_len() const { return tag_len_; }

  private:
    EVP_CIPHER_CTX *ctx_;
    EVP_CIPHER *cipher_ = nullptr;
    size_t tag_len_ = 0; // bytes
    bool payload_started_ = false;
};

AeEngine &engine(Operation &op) {
    return static_cast<AeEngine &>(*op.engine);
}

} // namespace

TEE_Result ae_setup(Operation &op) {
    if (op.info.algorithm != TEE_ALG_AES_GCM)
        return TEE_ERROR_NOT_SUPPORTED;
    if (op.info.mode != TEE_MODE_ENCRYPT && op.info.mode != TEE_MODE_DECRYPT)
        return TEE_ERROR_NOT_SUPPORTED;
    if (!secret_object_type(TEE_TYPE_AES)->size_ok(op.info.maxKeySize))
        return TEE_ERROR_NOT_SUPPORTED;
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    if (!ctx)
        return TEE_ERROR_OUT_OF_MEMORY;
    op.engine = std::make_unique<AeEngine>(ctx);
    op.info.requiredKeyUsage = op.info.mode == TEE_MODE_ENCRYPT ? TEE_USAGE_ENCRYPT : TEE_USAGE_DECRYPT;
    return TEE_SUCCESS;
}

} // namespace tee_host::detail

using namespace tee_host::detail;

extern "C" {

TEE_Result TEE_AEInit(TEE_OperationHandle operation, const void *nonce, uint32_t nonceLen, uint32_t tagLen, uint32_t,
                      uint32_t) {
    // The AAD and payload lengths matter only to CCM.
    Operation &op = operation_from_handle(operation, TEE_OPERATION_AE, __func__);
    require_key(op, __func__);
    if (nonceLen && !nonce)
        panic("TEE_AEInit with a null nonce");
    if (tagLen < kMinTagBits || tagLen > kMaxTagBits || tagLen % 8 != 0)
        return TEE_ERROR_NOT_SUPPORTED;
    if (nonceLen < 1 || nonceLen > kMaxNonce)
        return TEE_ERROR_NOT_SUPPORTED;
    engine(op).init(secret_value(op), static_cast<const uint8_t *>(nonce), nonceLen, tagLen / 8,
                    op.info.mode == TEE_MODE_ENCRYPT);
    op.info.digestLength = tagLen / 8;
    begin(op);
    return TEE_SUCCESS;
}

void TEE_AEUpdateAAD(TEE_OperationHandle operation, const void *AADdata, uint32_t AADdataLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_AE, __func__);
    require_initialized(op, __func__);
    if (AADdataLen && !AADdata)
        panic("TEE_AEUpdateAAD with null data");
    engine(op).aad(static_cast<const uint8_t *>(AADdata), AADdataLen);
}

TEE_Result TEE_AEUpdate(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                        uint32_t *destLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_AE, __func__);
    require_initialized(op, __func__);
    if (!output_fits(destLen, srcLen, __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if (srcLen && !destData)
        panic("TEE_AEUpdate into a null buffer");
    InputView in(srcData, srcLen, destData, *destLen, __func__, true);
    engine(op).update(in.data(), in.size(), static_cast<uint8_t *>(destData));
    *destLen = srcLen;
    return TEE_SUCCESS;
}

TEE_Result TEE_AEEncryptFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                              uint32_t *destLen, void *tag, uint32_t *tagLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_AE, __func__);
    require_mode(op, TEE_MODE_ENCRYPT, __func__);
    require_initialized(op, __func__);
    AeEngine &e = engine(op);
    // Both sizes are checked before anything is consumed.
    bool data_fits = output_fits(destLen, srcLen, __func__);
    bool tag_fits = output_fits(tagLen, e.tag_len(), __func__);
    if (!data_fits || !tag_fits)
        return TEE_ERROR_SHORT_BUFFER;
    if ((srcLen && !destData) || !tag)
        panic("TEE_AEEncryptFinal into a null buffer");
    InputView in(srcData, srcLen, destData, *destLen, __func__, true);
    e.update(in.data(), in.size(), static_cast<uint8_t *>(destData));
    e.encrypt_final(static_cast<uint8_t *>(tag));
    *destLen = srcLen;
    *tagLen = static_cast<uint32_t>(e.tag_len());
    finish(op);
    return TEE_SUCCESS;
}

TEE_Result TEE_AEDecryptFinal(TEE_OperationHandle operation, const void *srcData, uint32_t srcLen, void *destData,
                              uint32_t *destLen, const void *tag, uint32_t tagLen) {
    Operation &op = operation_from_handle(operation, TEE_OPERATION_AE, __func__);
    require_mode(op, TEE_MODE_DECRYPT, __func__);
    require_initialized(op, __func__);
    if (!output_fits(destLen, srcLen, __func__))
        return TEE_ERROR_SHORT_BUFFER;
    if ((srcLen && !destData) || (tagLen && !tag))
        panic("TEE_AEDecryptFinal with a null buffer");
    if (srcLen && !srcData)
        panic("TEE_AEDecryptFinal with null input");
    AeEngine &e = engine(op);
    if (tagLen != e.tag_len()) {
        finish(op);
        *destLen = 0;
        return TEE_ERROR_MAC_INVALID;
    }
    SecretBytes plain(srcLen);
    bool ok =
        e.decrypt_final(static_cast<const uint8_t *>(srcData), srcLen, plain.data(), static_cast<const uint8_t *>(tag));
    finish(op);
    if (!ok) {
        *destLen = 0;
        return TEE_ERROR_MAC_INVALID;
    }
    if (srcLen)
        std::copy(plain.begin(), plain.end(), static_cast<uint8_t *>(destData));
    *destLen = srcLen;
    return TEE_SUCCESS;
}

} // extern "C"
