/*
 * rsa_rows.cpp - RSA-2048 signing and verification (PKCS#1 v1.5 and PSS
 * over SHA-256) through the TA beside OpenSSL on a preloaded key.
 */
#include <memory>
#include <stdexcept>

#include <benchmark/benchmark.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>

#include "keymaster_defs.h"
#include "rows.h"

namespace bench {
namespace {

// A 2048-bit key made once for the run, as PKCS#8 PEM.
Bytes fresh_pkcs8(EVP_PKEY **pkey) {
    *pkey = EVP_RSA_gen(2048);
    BIO *bio = BIO_new(BIO_s_mem());
    if (!*pkey || !bio || PEM_write_bio_PrivateKey(bio, *pkey, nullptr, nullptr, 0, nullptr, nullptr) != 1)
        throw std::runtime_error("RSA key generation failed");
    char *data = nullptr;
    long n = BIO_get_mem_data(bio, &data);
    Bytes pem(data, data + n);
    BIO_free(bio);
    return pem;
}

// One preloaded signing or verifying context; each operation hashes the
// message and signs or verifies the digest.
class RawRsa {
  public:
    RawRsa(EVP_PKEY *key, int padding, bool sign) : sign_(sign) {
        ctx_ = EVP_PKEY_CTX_new_from_pkey(nullptr, key, nullptr);
        int ok = ctx_ && (sign ? EVP_PKEY_sign_init(ctx_) : EVP_PKEY_verify_init(ctx_)) == 1 &&
                 EVP_PKEY_CTX_set_rsa_padding(ctx_, padding) == 1 &&
                 EVP_PKEY_CTX_set_signature_md(ctx_, EVP_sha256()) == 1;
        if (ok && padding == RSA_PKCS1_PSS_PADDING)
            ok = EVP_PKEY_CTX_set_rsa_pss_saltlen(ctx_, RSA_PSS_SALTLEN_DIGEST) == 1;
        if (!ok)
            throw std::runtime_error("EVP_PKEY RSA setup failed");
    }
    ~RawRsa() { EVP_PKEY_CTX_free(ctx_); }
    RawRsa(const RawRsa &) = delete;
    RawRsa &operator=(const RawRsa &) = delete;

    const Bytes &run(const Bytes &msg, const Bytes &signature) {
        unsigned char digest[32];
        unsigned int dlen = 0;
        size_t n = 256;
        out_.resize(n);
        if (EVP_Digest(msg.data(), msg.size(), digest, &dlen, EVP_sha256(), nullptr) != 1 ||
            (sign_ ? EVP_PKEY_sign(ctx_, out_.data(), &n, digest, dlen)
                   : EVP_PKEY_verify(ctx_, signature.data(), signature.size(), digest, dlen)) != 1)
            throw std::runtime_error("EVP_PKEY RSA operation failed");
        out_.resize(sign_ ? n : 0);
        return out_;
    }

  private:
    EVP_PKEY_CTX *ctx_ = nullptr;
    bool sign_;
    Bytes out_;
};

// The SoftHSM2 side of a PKCS#1 v1.5 row: the same key and message, its
// result checked once against OpenSSL's.
Side softhsm_rsa(const Hsm &hsm, p11::Storage storage, EVP_PKEY *key, bool sign, const Bytes &msg,
                 const Bytes &signature, const std::string &name) {
    const CK_MECHANISM_TYPE type = CKM_SHA256_RSA_PKCS;
    if (sign) {
        auto signer = std::make_shared<p11::Signer>(p11::rsa_private_key(hsm, key, storage), type, msg, 256);
        RawRsa openssl(key, RSA_PKCS1_PADDING, true);
        // PKCS#1 v1.5 signatures are deterministic.
        if (signer->run() != openssl.run(msg, {}))
            throw std::runtime_error(name + ": SoftHSM2 and OpenSSL disagree");
        return [signer] { benchmark::DoNotOptimize(signer->run().data()); };
    }
    auto pub = p11::rsa_public_key(hsm, key, storage);
    auto verify = [pub, msg, signature, mech = p11::mechanism(type)] {
        return pub->token().verify(pub->handle(), mech, msg, signature);
    };
    if (!verify())
        throw std::runtime_error(name + ": SoftHSM2 rejects the signature");
    return [verify] {
        if (!verify())
            throw std::runtime_error("SoftHSM2 rejected the signature");
    };
}

Row rsa_row(TaSession &ta, const Hsm &hsm, EVP_PKEY *key, const Bytes &blob, const char *name, uint32_t padding,
            int raw_padding, bool sign, double target_raw, double target_softhsm) {
    km::ParamSet begin;
    begin.add(KM_TAG_PADDING, padding).add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    auto msg = std::make_shared<Bytes>(message(64));
    Bytes signature;
    if (!sign) {
        TaOperation signer(ta, KM_PURPOSE_SIGN, blob, begin, *msg);
        signature = signer.run();
    }
    auto op =
        std::make_shared<TaOperation>(ta, sign ? KM_PURPOSE_SIGN : KM_PURPOSE_VERIFY, blob, begin, *msg, signature);
    auto raw = std::make_shared<RawRsa>(key, raw_padding, sign);
    // Both sides must work on the same thing before they are timed: the
    // TA's signature verifies with OpenSSL, OpenSSL's raw signature with the TA.
    const Bytes made = op->run();
    if (sign) {
        RawRsa check(key, raw_padding, false);
        check.run(*msg, made);
    }
    auto sig = std::make_shared<Bytes>(signature);
    const std::string row = std::string("rsa2048_") + name + (sign ? "_sign" : "_verify");
    return timed_row(
        row, 64, target_raw, [op] { benchmark::DoNotOptimize(op->run().data()); },
        [raw, msg, sig] { benchmark::DoNotOptimize(raw->run(*msg, *sig).data()); }, target_softhsm, hsm,
        [&](p11::Storage storage) { return softhsm_rsa(hsm, storage, key, sign, *msg, signature, row); });
}

} // namespace

std::vector<Row> rsa_rows(TaSession &ta, const Hsm &hsm) {
    EVP_PKEY *raw_key = nullptr;
    const Bytes pem = fresh_pkcs8(&raw_key);
    std::shared_ptr<EVP_PKEY> key(raw_key, EVP_PKEY_free);
    km::ParamSet params;
    params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
        .add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN)
        .add(KM_TAG_PADDING, KM_PAD_RSA_PSS)
        .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    const Bytes blob = ta.import_private_key(params, KM_ALGORITHM_RSA, pem);
    // The rows keep the key alive through their raw contexts' own references.
    // Only PKCS#1 v1.5 is compared with SoftHSM2; PSS verification is informational.
    std::vector<Row> rows = {
        rsa_row(ta, hsm, key.get(), blob, "pkcs1_sha256", KM_PAD_RSA_PKCS1_1_5_SIGN, RSA_PKCS1_PADDING, true, 0.90,
                1.8),
        rsa_row(ta, hsm, key.get(), blob, "pss_sha256", KM_PAD_RSA_PSS, RSA_PKCS1_PSS_PADDING, true, 0.90, 0),
        rsa_row(ta, hsm, key.get(), blob, "pkcs1_sha256", KM_PAD_RSA_PKCS1_1_5_SIGN, RSA_PKCS1_PADDING, false, 0.80,
                1.2),
        rsa_row(ta, hsm, key.get(), blob, "pss_sha256", KM_PAD_RSA_PSS, RSA_PKCS1_PSS_PADDING, false, 0, 0),
    };
    return rows;
}

} // namespace bench
