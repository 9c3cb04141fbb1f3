/*
 * aes_rows.cpp - AES-GCM and AES-CBC-PKCS7 through the TA beside EVP_CIPHER
 * on a key loaded once. Large messages go in 64 KiB updates on both sides.
 */
#include <memory>
#include <stdexcept>

#include <benchmark/benchmark.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>

#include "keymaster_defs.h"
#include "rows.h"
#include "ta_entry.h"

namespace bench {
namespace {

constexpr size_t kChunk = 64 * 1024;
constexpr uint32_t kTagBits = 128;

// An EVP_CIPHER_CTX keyed once; each run only sets the IV again.
class RawCipher {
  public:
    RawCipher(const EVP_CIPHER *cipher, const Bytes &key, bool pkcs7)
        : gcm_(EVP_CIPHER_get_mode(cipher) == EVP_CIPH_GCM_MODE) {
        ctx_ = EVP_CIPHER_CTX_new();
        if (!ctx_ || EVP_EncryptInit_ex2(ctx_, cipher, key.data(), nullptr, nullptr) != 1 ||
            EVP_CIPHER_CTX_set_padding(ctx_, pkcs7 ? 1 : 0) != 1)
            throw std::runtime_error("EVP cipher setup failed");
    }
    ~RawCipher() { EVP_CIPHER_CTX_free(ctx_); }
    RawCipher(const RawCipher &) = delete;
    RawCipher &operator=(const RawCipher &) = delete;

    // encrypt - the message in chunks of `chunk` bytes; ciphertext then tag (GCM).
    const Bytes &encrypt(const Bytes &iv, const Bytes &msg, size_t chunk) {
        out_.resize(msg.size() + 32);
        int len = 0;
        size_t at = 0;
        if (EVP_EncryptInit_ex2(ctx_, nullptr, nullptr, iv.data(), nullptr) != 1)
            throw std::runtime_error("EVP cipher init failed");
        for (size_t off = 0; off < msg.size(); off += chunk) {
            const size_t n = std::min(chunk, msg.size() - off);
            if (EVP_EncryptUpdate(ctx_, out_.data() + at, &len, msg.data() + off, static_cast<int>(n)) != 1)
                throw std::runtime_error("EVP cipher update failed");
            at += static_cast<size_t>(len);
        }
        if (EVP_EncryptFinal_ex(ctx_, out_.data() + at, &len) != 1)
            throw std::runtime_error("EVP cipher final failed");
        at += static_cast<size_t>(len);
        if (gcm_) {
            OSSL_PARAM params[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, out_.data() + at, 16),
                                   OSSL_PARAM_construct_end()};
            if (EVP_CIPHER_CTX_get_params(ctx_, params) != 1)
                throw std::runtime_error("EVP tag failed");
            at += 16;
        }
        out_.resize(at);
        return out_;
    }

  private:
    EVP_CIPHER_CTX *ctx_ = nullptr;
    bool gcm_;
    Bytes out_;
};

// One TA encryption, begin / one update per chunk / finish, with every
// request built once. run() returns nothing so that nothing but the
// commands is timed; collect() gathers the output for the agreement check.
class TaCipher {
  public:
    TaCipher(TaSession &ta, const Bytes &blob, const km::ParamSet &begin_params, const Bytes &msg, size_t chunk)
        : ta_(ta) {
        const Bytes none = km::ParamSet().serialize();
        km::put_lv(begin_request_, blob);
        km::put_lv(begin_request_, begin_params.serialize());
        for (size_t off = 0; off < msg.size(); off += chunk) {
            Bytes piece(msg.begin() + static_cast<std::ptrdiff_t>(off),
                        msg.begin() + static_cast<std::ptrdiff_t>(std::min(msg.size(), off + chunk)));
            Bytes req;
            km::put_lv(req, piece);
            km::put_lv(req, none);
            updates_.push_back(std::move(req));
        }
        km::put_lv(finish_request_, {});
        km::put_lv(finish_request_, none);
        response_.resize(chunk + 4096);
    }

    void run(Bytes *collect = nullptr) {
        Reply r = ta_.invoke(KM_CMD_BEGIN, KM_PURPOSE_ENCRYPT, begin_request_, response_);
        if (!r.ok())
            throw TaFailure("begin", r);
        const uint32_t handle = r.b;
        for (const Bytes &req : updates_) {
            r = ta_.invoke(KM_CMD_UPDATE, handle, req, response_);
            if (!r.ok())
                throw TaFailure("update", r);
            if (collect)
                collect->insert(collect->end(), response_.begin(), response_.begin() + r.out_len);
        }
        r = ta_.invoke(KM_CMD_FINISH, handle, finish_request_, response_);
        if (!r.ok() || r.out_len < 8)
            throw TaFailure("finish", r);
        if (collect) {
            const uint32_t len = km::get_u32(response_.data());
            collect->insert(collect->end(), response_.begin() + 4, response_.begin() + 4 + len);
        }
    }

  private:
    TaSession &ta_;
    Bytes begin_request_;
    std::vector<Bytes> updates_;
    Bytes finish_request_;
    Bytes response_;
};

Bytes fixed(size_t n, uint8_t base) {
    Bytes b(n);
    for (size_t i = 0; i < n; ++i)
        b[i] = static_cast<uint8_t>(base + i);
    return b;
}

// The SoftHSM2 side of a GCM row: the same key, IV and message in one
// C_Encrypt; ciphertext and tag checked once against OpenSSL's.
Side softhsm_gcm(const Hsm &hsm, p11::Storage storage, const Bytes &key, const Bytes &iv,
                 const std::shared_ptr<Bytes> &msg, const Bytes &expected, const std::string &name) {
    auto obj = p11::secret_key(hsm, CKK_AES, key, storage);
    auto gcm = std::make_shared<p11::GcmMechanism>(iv, kTagBits);
    Bytes out(msg->size() + kTagBits / 8);
    obj->token().encrypt(obj->handle(), gcm->get(), *msg, out);
    if (out != expected)
        throw std::runtime_error(name + ": SoftHSM2 and OpenSSL disagree");
    return [obj, gcm, msg, out]() mutable {
        obj->token().encrypt(obj->handle(), gcm->get(), *msg, out);
        benchmark::DoNotOptimize(out.data());
    };
}

Row aes_row(TaSession &ta, const Hsm &hsm, const std::string &algorithm, const EVP_CIPHER *cipher, uint32_t mode,
            uint32_t padding, size_t key_bytes, const std::string &size, size_t n, size_t chunk, double target_raw,
            double target_softhsm) {
    const Bytes key = fixed(key_bytes, 0x40);
    const Bytes iv = fixed(mode == KM_MODE_GCM ? 12 : 16, 0x90);
    km::ParamSet key_params;
    key_params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES)
        .add(KM_TAG_BLOCK_MODE, mode)
        .add(KM_TAG_PADDING, padding)
        .add(KM_TAG_MIN_MAC_LENGTH, kTagBits)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT)
        .add_bool(KM_TAG_CALLER_NONCE)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    const Bytes blob = ta.import_key(key_params, key);
    km::ParamSet begin;
    begin.add(KM_TAG_BLOCK_MODE, mode).add(KM_TAG_PADDING, padding).add_bytes(KM_TAG_NONCE, iv);
    if (mode == KM_MODE_GCM)
        begin.add(KM_TAG_MAC_LENGTH, kTagBits);
    auto msg = std::make_shared<Bytes>(message(n));
    auto op = std::make_shared<TaCipher>(ta, blob, begin, *msg, chunk);
    auto raw = std::make_shared<RawCipher>(cipher, key, padding == KM_PAD_PKCS7);
    const std::string name = algorithm + "_" + size;
    // Timing a wrong ciphertext would be meaningless: all sides must agree.
    Bytes ours;
    op->run(&ours);
    const Bytes expected = raw->encrypt(iv, *msg, chunk);
    if (ours != expected)
        throw std::runtime_error(name + ": the TA and OpenSSL disagree");
    return timed_row(
        name, static_cast<int64_t>(n), target_raw, [op] { op->run(); },
        [raw, msg, iv, chunk] { benchmark::DoNotOptimize(raw->encrypt(iv, *msg, chunk).data()); }, target_softhsm, hsm,
        [&](p11::Storage storage) { return softhsm_gcm(hsm, storage, key, iv, msg, expected, name); });
}

} // namespace

std::vector<Row> aes_rows(TaSession &ta, const Hsm &hsm) {
    return {
        // One begin, sixteen 64 KiB updates, finish: the cipher dominates.
        aes_row(ta, hsm, "aes256_gcm", EVP_aes_256_gcm(), KM_MODE_GCM, KM_PAD_NONE, 32, "1MiB", 1024 * 1024, kChunk,
                0.90, 8),
        // Opening the blob and keying dominate a small message.
        aes_row(ta, hsm, "aes256_gcm", EVP_aes_256_gcm(), KM_MODE_GCM, KM_PAD_NONE, 32, "1KiB", 1024, 1024, 0.15, 2),
        aes_row(ta, hsm, "aes128_cbc_pkcs7", EVP_aes_128_cbc(), KM_MODE_CBC, KM_PAD_PKCS7, 16, "1MiB", 1024 * 1024,
                kChunk, 0.90, 0),
    };
}

} // namespace bench
