/*
 * hmac_rows.cpp - HMAC-SHA-256 through the TA beside EVP_MAC.
 */
#include <memory>
#include <stdexcept>

#include <benchmark/benchmark.h>
#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>

#include "keymaster_defs.h"
#include "rows.h"

namespace bench {
namespace {

constexpr uint32_t kMacBits = 256;

// A keyed EVP_MAC context made once; each MAC re-initialises it without a
// key, which restarts from the stored inner and outer pads.
class RawHmac {
  public:
    RawHmac(const Bytes &key, const char *digest) {
        mac_ = EVP_MAC_fetch(nullptr, "HMAC", nullptr);
        ctx_ = mac_ ? EVP_MAC_CTX_new(mac_) : nullptr;
        OSSL_PARAM params[] = {
            OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, const_cast<char *>(digest), 0),
            OSSL_PARAM_construct_end(),
        };
        if (!ctx_ || EVP_MAC_init(ctx_, key.data(), key.size(), params) != 1)
            throw std::runtime_error("EVP_MAC HMAC setup failed");
    }
    ~RawHmac() {
        EVP_MAC_CTX_free(ctx_);
        EVP_MAC_free(mac_);
    }
    RawHmac(const RawHmac &) = delete;
    RawHmac &operator=(const RawHmac &) = delete;

    const Bytes &mac(const Bytes &msg) {
        size_t len = 0;
        out_.resize(EVP_MAX_MD_SIZE);
        if (EVP_MAC_init(ctx_, nullptr, 0, nullptr) != 1 || EVP_MAC_update(ctx_, msg.data(), msg.size()) != 1 ||
            EVP_MAC_final(ctx_, out_.data(), &len, out_.size()) != 1)
            throw std::runtime_error("EVP_MAC HMAC failed");
        out_.resize(len);
        return out_;
    }

  private:
    EVP_MAC *mac_ = nullptr;
    EVP_MAC_CTX *ctx_ = nullptr;
    Bytes out_;
};

Bytes fixed_key() {
    Bytes key(32);
    for (size_t i = 0; i < key.size(); ++i)
        key[i] = static_cast<uint8_t>(0xA0 + i);
    return key;
}

Row hmac_row(TaSession &ta, const Hsm &hsm, const Bytes &key, const Bytes &blob, const std::shared_ptr<RawHmac> &raw,
             const std::string &size, size_t n, double target_raw, double target_softhsm) {
    auto op = std::make_shared<TaOperation>(ta, KM_PURPOSE_SIGN, blob, hmac_begin_params(), message(n));
    auto msg = std::make_shared<Bytes>(message(n));
    const std::string name = "hmac_sha256_" + size;
    // Timing a wrong MAC would be meaningless: all sides must agree.
    const Bytes expected = raw->mac(*msg);
    if (op->run() != expected)
        throw std::runtime_error(name + ": the TA and OpenSSL disagree");
    return timed_row(
        name, static_cast<int64_t>(n), target_raw, [op] { benchmark::DoNotOptimize(op->run().data()); },
        [raw, msg] { benchmark::DoNotOptimize(raw->mac(*msg).data()); }, target_softhsm, hsm,
        [&](p11::Storage storage) -> Side {
            auto signer = std::make_shared<p11::Signer>(p11::secret_key(hsm, CKK_GENERIC_SECRET, key, storage),
                                                        CKM_SHA256_HMAC, *msg, kMacBits / 8);
            if (signer->run() != expected)
                throw std::runtime_error(name + ": SoftHSM2 and OpenSSL disagree");
            return [signer] { benchmark::DoNotOptimize(signer->run().data()); };
        });
}

} // namespace

km::ParamSet hmac_key_params() {
    km::ParamSet params;
    params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
        .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
        .add(KM_TAG_MIN_MAC_LENGTH, kMacBits)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    return params;
}

km::ParamSet hmac_begin_params() {
    km::ParamSet params;
    params.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_MAC_LENGTH, kMacBits);
    return params;
}

std::vector<Row> hmac_rows(TaSession &ta, const Hsm &hsm) {
    const Bytes key = fixed_key();
    const Bytes blob = ta.import_key(hmac_key_params(), key);
    auto raw = std::make_shared<RawHmac>(key, "SHA2-256");
    return {
        // Opening the blob, keying and three commands dominate a tiny MAC.
        hmac_row(ta, hsm, key, blob, raw, "64B", 64, 0.15, 1.5),
        // The hashing dominates; the TA's fixed cost should vanish.
        hmac_row(ta, hsm, key, blob, raw, "64KiB", 64 * 1024, 0.90, 0),
    };
}

} // namespace bench
