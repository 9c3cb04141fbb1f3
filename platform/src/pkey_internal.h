/*
 * pkey_internal.h - the asymmetric families (crypto_rsa.cpp, crypto_ec.cpp):
 * how they plug into the object layer (objects.cpp) and the operation layer
 * (crypto_operation.cpp), and what they share: owning handles for OpenSSL's
 * key, context, number and parameter types, and conversions between
 * big-endian attribute bytes and BIGNUMs.
 */
#ifndef PKEY_INTERNAL_H
#define PKEY_INTERNAL_H

#include <cstddef>
#include <cstdint>
#include <memory>

#include <openssl/bn.h>
#include <openssl/evp.h>
#include <openssl/param_build.h>
#include <openssl/params.h>

#include "object_internal.h"
#include "operation_internal.h"

namespace tee_host::detail {

// rsa_object_type / ec_object_type - the rules for TEE_TYPE_RSA_KEYPAIR and
// TEE_TYPE_RSA_PUBLIC_KEY, and for TEE_TYPE_ECDSA_KEYPAIR and
// TEE_TYPE_ECDSA_PUBLIC_KEY; null for any other type.
const ObjectTypeOps *rsa_object_type(uint32_t type);
const ObjectTypeOps *ec_object_type(uint32_t type);

// rsa_setup / ec_setup - the RSA and ECDSA parts of TEE_AllocateOperation
// (see digest_setup). TEE_SUCCESS with digestLength, requiredKeyUsage and
// the engine set; TEE_ERROR_NOT_SUPPORTED for an algorithm, mode or
// maxKeySize the family does not do (for ECDSA, any size but the curve's).
TEE_Result rsa_setup(Operation &op);
TEE_Result ec_setup(Operation &op);

struct BnFree {
    void operator()(BIGNUM *b) const { BN_clear_free(b); }
};
using Bn = std::unique_ptr<BIGNUM, BnFree>;
struct BnCtxFree {
    void operator()(BN_CTX *c) const { BN_CTX_free(c); }
};
using BnCtx = std::unique_ptr<BN_CTX, BnCtxFree>;
struct PkeyCtxFree {
    void operator()(EVP_PKEY_CTX *c) const { EVP_PKEY_CTX_free(c); }
};
using PkeyCtx = std::unique_ptr<EVP_PKEY_CTX, PkeyCtxFree>;
struct PkeyFree {
    void operator()(EVP_PKEY *k) const { EVP_PKEY_free(k); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;
struct ParamBldFree {
    void operator()(OSSL_PARAM_BLD *b) const { OSSL_PARAM_BLD_free(b); }
};
using ParamBld = std::unique_ptr<OSSL_PARAM_BLD, ParamBldFree>;
struct ParamFree {
    void operator()(OSSL_PARAM *p) const { OSSL_PARAM_free(p); }
};
using Params = std::unique_ptr<OSSL_PARAM, ParamFree>;

// to_bn - the integer in big-endian bytes, in memory OpenSSL wipes when
// freed. Panics when OpenSSL is out of memory.
inline Bn to_bn(const uint8_t *p, size_t n) {
    Bn bn(BN_secure_new());
    if (!bn || !BN_bin2bn(p, static_cast<int>(n), bn.get()))
        panic("the crypto backend is out of memory");
    return bn;
}
inline Bn to_bn(const SecretBytes &b) {
    return to_bn(b.data(), b.size());
}
inline Bn new_bn() {
    return to_bn(nullptr, 0);
}
// attr_bn - the buffer attribute `id` of attrs, which must hold it.
inline Bn attr_bn(const AttributeMap &attrs, uint32_t id) {
    return to_bn(attrs.at(id).bytes);
}

// from_bn - the integer as minimal unsigned big-endian bytes.
inline SecretBytes from_bn(const BIGNUM *bn) {
    SecretBytes out(static_cast<size_t>(BN_num_bytes(bn)));
    BN_bn2bin(bn, out.data());
    return out;
}

// pkey_bn - a BIGNUM parameter of a key (OSSL_PKEY_PARAM_*); panics when
// the key has none, which the callers' keys always do.
inline Bn pkey_bn(const EVP_PKEY *pkey, const char *param) {
    BIGNUM *bn = nullptr;
    if (EVP_PKEY_get_bn_param(pkey, param, &bn) != 1)
        panic("the crypto backend could not read a key component");
    return Bn(bn);
}

// pkey_generate - a fresh key of OpenSSL's key type `name` ("RSA", "EC"),
// made with the parameters in bld, on OpenSSL's default generator. Panics
// when OpenSSL fails.
inline Pkey pkey_generate(const char *name, OSSL_PARAM_BLD *bld) {
    Params params(OSSL_PARAM_BLD_to_param(bld));
    PkeyCtx ctx(EVP_PKEY_CTX_new_from_name(nullptr, name, nullptr));
    EVP_PKEY *pkey = nullptr;
    if (!params || !ctx || EVP_PKEY_keygen_init(ctx.get()) != 1 ||
        EVP_PKEY_CTX_set_params(ctx.get(), params.get()) != 1 || EVP_PKEY_generate(ctx.get(), &pkey) != 1)
        panic("the crypto backend failed to generate a key");
    return Pkey(pkey);
}

// pkey_from_data - a new key (the caller's) of type `name` from the
// components in bld, as EVP_PKEY_KEYPAIR or EVP_PKEY_PUBLIC_KEY (selection).
// Null when OpenSSL refuses the components. Private components pushed as
// secure BIGNUMs end up in a block that is wiped when freed.
inline EVP_PKEY *pkey_from_data(const char *name, int selection, OSSL_PARAM_BLD *bld) {
    Params params(OSSL_PARAM_BLD_to_param(bld));
    PkeyCtx ctx(EVP_PKEY_CTX_new_from_name(nullptr, name, nullptr));
    if (!params || !ctx || EVP_PKEY_fromdata_init(ctx.get()) != 1)
        panic("the crypto backend is out of memory");
    EVP_PKEY *pkey = nullptr;
    if (EVP_PKEY_fromdata(ctx.get(), &pkey, selection, params.get()) != 1)
        return nullptr;
    return pkey;
}

} // namespace tee_host::detail

#endif
