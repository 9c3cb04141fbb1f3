/*
 * soter_keys.h - OpenSSL-side views of RSA keys for the SOTER tests: a key
 * text decoded and re-encoded, so that what the TA or kmctl wrote can be
 * compared with the key it came from.
 */
#ifndef SOTER_KEYS_H
#define SOTER_KEYS_H

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/decoder.h>
#include <openssl/encoder.h>
#include <openssl/evp.h>

#include "tee_host.h"

struct PkeyFree {
    void operator()(EVP_PKEY *p) const { EVP_PKEY_free(p); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;

// decode_rsa - an RSA key, private or public, PEM or DER; null when it does not decode.
inline Pkey decode_rsa(const std::string &text) {
    EVP_PKEY *pkey = nullptr;
    OSSL_DECODER_CTX *ctx = OSSL_DECODER_CTX_new_for_pkey(&pkey, nullptr, nullptr, "RSA", 0, nullptr, nullptr);
    const unsigned char *p = reinterpret_cast<const unsigned char *>(text.data());
    size_t len = text.size();
    bool ok = ctx && OSSL_DECODER_from_data(ctx, &p, &len) == 1;
    OSSL_DECODER_CTX_free(ctx);
    if (!ok) {
        EVP_PKEY_free(pkey);
        return nullptr;
    }
    return Pkey(pkey);
}

// der_of - the selected part of the key as DER in `structure`; empty on failure.
inline std::vector<uint8_t> der_of(const EVP_PKEY *key, int selection, const char *structure) {
    if (!key)
        return {};
    OSSL_ENCODER_CTX *ctx = OSSL_ENCODER_CTX_new_for_pkey(key, selection, "DER", structure, nullptr);
    unsigned char *der = nullptr;
    size_t der_len = 0;
    bool ok = ctx && OSSL_ENCODER_to_data(ctx, &der, &der_len) == 1;
    OSSL_ENCODER_CTX_free(ctx);
    std::vector<uint8_t> out;
    if (ok)
        out.assign(der, der + der_len);
    OPENSSL_free(der);
    return out;
}

// spki_of - the DER SubjectPublicKeyInfo of a key text; empty when it does not decode.
inline std::vector<uint8_t> spki_of(const std::string &text) {
    return der_of(decode_rsa(text).get(), EVP_PKEY_PUBLIC_KEY, "SubjectPublicKeyInfo");
}

// rsa_component - one unsigned big-endian component of an RSA key; empty when it has none.
inline std::vector<uint8_t> rsa_component(const EVP_PKEY *key, const char *name) {
    BIGNUM *bn = nullptr;
    if (EVP_PKEY_get_bn_param(key, name, &bn) != 1)
        return {};
    std::vector<uint8_t> out(static_cast<size_t>(BN_num_bytes(bn)), 0);
    BN_bn2bin(bn, out.data());
    BN_free(bn);
    return out;
}

// factory_key - the RSA components of a private key text as factory data
// (texts and UUID left for the caller).
inline tee_host::provisioning::FactoryData factory_key(const std::string &pem) {
    tee_host::provisioning::FactoryData d;
    Pkey key = decode_rsa(pem);
    const EVP_PKEY *k = key.get();
    d.n = rsa_component(k, OSSL_PKEY_PARAM_RSA_N);
    d.e = rsa_component(k, OSSL_PKEY_PARAM_RSA_E);
    d.d = rsa_component(k, OSSL_PKEY_PARAM_RSA_D);
    d.p = rsa_component(k, OSSL_PKEY_PARAM_RSA_FACTOR1);
    d.q = rsa_component(k, OSSL_PKEY_PARAM_RSA_FACTOR2);
    d.dp = rsa_component(k, OSSL_PKEY_PARAM_RSA_EXPONENT1);
    d.dq = rsa_component(k, OSSL_PKEY_PARAM_RSA_EXPONENT2);
    d.qinv = rsa_component(k, OSSL_PKEY_PARAM_RSA_COEFFICIENT1);
    return d;
}

#endif
