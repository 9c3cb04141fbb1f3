/*
 * ec_rows.cpp - ECDSA signing and verification of a 64-byte message
 * (P-256 and P-384, each with its SHA-2 digest) through the TA beside
 * OpenSSL on a preloaded key.
 */
#include <memory>
#include <stdexcept>
#include <string>

#include <benchmark/benchmark.h>
#include <openssl/evp.h>
#include <openssl/x509.h>

#include "keymaster_defs.h"
#include "rows.h"

namespace bench {
namespace {

// A key made once for the run, and its PKCS#8 DER for the TA's import.
Bytes fresh_pkcs8(const char *curve, EVP_PKEY **pkey) {
    *pkey = EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", curve);
    PKCS8_PRIV_KEY_INFO *p8 = *pkey ? EVP_PKEY2PKCS8(*pkey) : nullptr;
    unsigned char *der = nullptr;
    const int n = p8 ? i2d_PKCS8_PRIV_KEY_INFO(p8, &der) : 0;
    PKCS8_PRIV_KEY_INFO_free(p8);
    if (n <= 0)
        throw std::runtime_error(std::string("EC key generation failed on ") + curve);
    Bytes out(der, der + n);
    OPENSSL_free(der);
    return out;
}

// One preloaded signing or verifying context; each operation hashes the
// message and signs or verifies the digest.
class RawEcdsa {
  public:
    RawEcdsa(EVP_PKEY *key, const EVP_MD *md, bool sign) : md_(md), sign_(sign) {
        ctx_ = EVP_PKEY_CTX_new_from_pkey(nullptr, key, nullptr);
        if (!ctx_ || (sign ? EVP_PKEY_sign_init(ctx_) : EVP_PKEY_verify_init(ctx_)) != 1 ||
            EVP_PKEY_CTX_set_signature_md(ctx_, md) != 1)
            throw std::runtime_error("EVP_PKEY ECDSA setup failed");
    }
    ~RawEcdsa() { EVP_PKEY_CTX_free(ctx_); }
    RawEcdsa(const RawEcdsa &) = delete;
    RawEcdsa &operator=(const RawEcdsa &) = delete;

    const Bytes &run(const Bytes &msg, const Bytes &signature) {
        unsigned char digest[EVP_MAX_MD_SIZE];
        unsigned int dlen = 0;
        size_t n = 160;
        out_.resize(n);
        if (EVP_Digest(msg.data(), msg.size(), digest, &dlen, md_, nullptr) != 1 ||
            (sign_ ? EVP_PKEY_sign(ctx_, out_.data(), &n, digest, dlen)
                   : EVP_PKEY_verify(ctx_, signature.data(), signature.size(), digest, dlen)) != 1)
            throw std::runtime_error("EVP_PKEY ECDSA operation failed");
        out_.resize(sign_ ? n : 0);
        return out_;
    }

  private:
    EVP_PKEY_CTX *ctx_ = nullptr;
    const EVP_MD *md_;
    bool sign_;
    Bytes out_;
};

struct Curve {
    const char *name;  // OpenSSL's
    const char *label; // in the row name, with the digest its own
    uint32_t digest;
    const EVP_MD *(*md)();
};

// The SoftHSM2 side of the P-256 signing row: the same key and message; its
// signature checked once with OpenSSL.
Side softhsm_ecdsa(const Hsm &hsm, p11::Storage storage, EVP_PKEY *key, const Bytes &msg, const std::string &name) {
    auto priv = p11::ec_private_key(hsm, key, storage);
    // Where SoftHSM2 signs only digests, the hashing is timed with it.
    auto signer = hsm->supports(CKM_ECDSA_SHA256)
                      ? std::make_shared<p11::Signer>(priv, CKM_ECDSA_SHA256, msg, 64)
                      : std::make_shared<p11::Signer>(priv, CKM_ECDSA, msg, 64, EVP_sha256());
    RawEcdsa check(key, EVP_sha256(), false);
    const Bytes der = p11::ecdsa_der(signer->run());
    try {
        check.run(msg, der);
    } catch (const std::exception &) {
        throw std::runtime_error(name + ": OpenSSL rejects SoftHSM2's signature");
    }
    return [signer] { benchmark::DoNotOptimize(signer->run().data()); };
}

Row ec_row(TaSession &ta, const Hsm &hsm, EVP_PKEY *key, const Bytes &blob, const Curve &c, bool sign,
           double target_raw, double target_softhsm) {
    km::ParamSet begin;
    begin.add(KM_TAG_DIGEST, c.digest);
    auto msg = std::make_shared<Bytes>(message(64));
    Bytes signature;
    if (!sign) {
        TaOperation signer(ta, KM_PURPOSE_SIGN, blob, begin, *msg);
        signature = signer.run();
    }
    auto op =
        std::make_shared<TaOperation>(ta, sign ? KM_PURPOSE_SIGN : KM_PURPOSE_VERIFY, blob, begin, *msg, signature);
    auto raw = std::make_shared<RawEcdsa>(key, c.md(), sign);
    // Both sides must work on the same thing before they are timed: the
    // TA's signature verifies with OpenSSL.
    const Bytes made = op->run();
    if (sign) {
        RawEcdsa check(key, c.md(), false);
        check.run(*msg, made);
    }
    auto sig = std::make_shared<Bytes>(signature);
    const std::string name = std::string("ecdsa_") + c.label + (sign ? "_sign" : "_verify");
    return timed_row(
        name, 64, target_raw, [op] { benchmark::DoNotOptimize(op->run().data()); },
        [raw, msg, sig] { benchmark::DoNotOptimize(raw->run(*msg, *sig).data()); }, target_softhsm, hsm,
        [&](p11::Storage storage) { return softhsm_ecdsa(hsm, storage, key, *msg, name); });
}

Bytes import_ec(TaSession &ta, const Bytes &pkcs8, uint32_t digest) {
    km::ParamSet params;
    params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_EC)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
        .add(KM_TAG_DIGEST, digest)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    return ta.import_private_key(params, KM_ALGORITHM_EC, pkcs8);
}

} // namespace

std::vector<Row> ec_rows(TaSession &ta, const Hsm &hsm) {
    const Curve p256{"P-256", "p256", KM_DIGEST_SHA_2_256, EVP_sha256};
    const Curve p384{"P-384", "p384", KM_DIGEST_SHA_2_384, EVP_sha384};
    std::vector<Row> rows;
    for (const Curve *c : {&p256, &p384}) {
        EVP_PKEY *raw_key = nullptr;
        const Bytes pkcs8 = fresh_pkcs8(c->name, &raw_key);
        std::shared_ptr<EVP_PKEY> key(raw_key, EVP_PKEY_free);
        const Bytes blob = import_ec(ta, pkcs8, c->digest);
        // The rows keep the key alive through their raw contexts' own references.
        if (c == &p256) {
            rows.push_back(ec_row(ta, hsm, key.get(), blob, *c, true, 0.75, 1.3));
            rows.push_back(ec_row(ta, hsm, key.get(), blob, *c, false, 0.80, 0));
        } else {
            rows.push_back(ec_row(ta, hsm, key.get(), blob, *c, true, 0, 0));
        }
    }
    return rows;
}

} // namespace bench
