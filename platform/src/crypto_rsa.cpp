/*
 * crypto_rsa.cpp - RSA on EVP_PKEY: the key-pair and public-key object
 * types and key generation; signatures over a digest (PKCS#1 v1.5, PSS),
 * raw RSA, PKCS#1 v1.5 and OAEP encryption; and the public-key export
 * extension.
 *
 * Every operation begin hands the platform a fresh copy of the key, and a
 * new OpenSSL key pays for its Montgomery and blinding set-up on its first
 * private-key operation, about as much as a signature. Prepared keys are
 * therefore shared through a small cache keyed by a digest of the key's
 * components.
 */
#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstring>
#include <vector>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/err.h>
#include <openssl/param_build.h>
#include <openssl/params.h>
#include <openssl/x509.h>

#include "crypto_state.h"
#include "pkey_internal.h"

namespace tee_host {
namespace detail {
namespace {

constexpr uint32_t kMinBits = 256;
constexpr uint32_t kMaxBits = 8192;
// OpenSSL's key generation refuses anything smaller.
constexpr uint32_t kMinGenerateBits = 512;
constexpr uint32_t kDefaultExponent = 65537;

constexpr uint32_t kPairRequired[] = {TEE_ATTR_RSA_MODULUS, TEE_ATTR_RSA_PUBLIC_EXPONENT,
                                      TEE_ATTR_RSA_PRIVATE_EXPONENT};
constexpr uint32_t kCrtAttrs[] = {TEE_ATTR_RSA_PRIME1, TEE_ATTR_RSA_PRIME2, TEE_ATTR_RSA_EXPONENT1,
                                  TEE_ATTR_RSA_EXPONENT2, TEE_ATTR_RSA_COEFFICIENT};
constexpr uint32_t kPublicRequired[] = {TEE_ATTR_RSA_MODULUS, TEE_ATTR_RSA_PUBLIC_EXPONENT};

// Each component with the name OpenSSL gives it, in the order of the
// attributes above.
struct Component {
    uint32_t attr;
    const char *param;
    bool secret;
};
constexpr Component kComponents[] = {
    {TEE_ATTR_RSA_MODULUS, OSSL_PKEY_PARAM_RSA_N, false},
    {TEE_ATTR_RSA_PUBLIC_EXPONENT, OSSL_PKEY_PARAM_RSA_E, false},
    {TEE_ATTR_RSA_PRIVATE_EXPONENT, OSSL_PKEY_PARAM_RSA_D, true},
    {TEE_ATTR_RSA_PRIME1, OSSL_PKEY_PARAM_RSA_FACTOR1, true},
    {TEE_ATTR_RSA_PRIME2, OSSL_PKEY_PARAM_RSA_FACTOR2, true},
    {TEE_ATTR_RSA_EXPONENT1, OSSL_PKEY_PARAM_RSA_EXPONENT1, true},
    {TEE_ATTR_RSA_EXPONENT2, OSSL_PKEY_PARAM_RSA_EXPONENT2, true},
    {TEE_ATTR_RSA_COEFFICIENT, OSSL_PKEY_PARAM_RSA_COEFFICIENT1, true},
};

bool rsa_size_ok(uint32_t bits) {
    return bits >= kMinBits && bits <= kMaxBits && bits % 8 == 0;
}

// --- Key objects -----------------------------------------------------------------

// exponent_ok - whether e can serve a modulus of nbits bits: odd, above
// 1, and no longer than 64 bits beyond 3072-bit moduli, which OpenSSL's
// public-key operation refuses.
bool exponent_ok(const BIGNUM *e, int nbits) {
    return BN_is_odd(e) && !BN_is_one(e) && BN_num_bits(e) < nbits && (nbits <= 3072 || BN_num_bits(e) <= 64);
}

// check_public - TEE_SUCCESS with *bits the modulus length when n and e
// make a usable public key; TEE_ERROR_BAD_PARAMETERS otherwise.
TEE_Result check_public(const BIGNUM *n, const BIGNUM *e, uint32_t *bits) {
    int nbits = BN_num_bits(n);
    if (nbits < static_cast<int>(kMinBits) || nbits > static_cast<int>(kMaxBits) || !BN_is_odd(n))
        return TEE_ERROR_BAD_PARAMETERS;
    if (!exponent_ok(e, nbits) || BN_cmp(e, n) >= 0)
        return TEE_ERROR_BAD_PARAMETERS;
    *bits = static_cast<uint32_t>(nbits);
    return TEE_SUCCESS;
}

// public_key_bits / pair_key_bits - ObjectTypeOps::key_bits of the two
// types (components already minimal).
TEE_Result public_key_bits(const AttributeMap &attrs, uint32_t *bits) {
    return check_public(attr_bn(attrs, TEE_ATTR_RSA_MODULUS).get(), attr_bn(attrs, TEE_ATTR_RSA_PUBLIC_EXPONENT).get(),
                        bits);
}

// crt_consistent - whether the CRT values describe the same key as n and
// d, which matters because OpenSSL uses them instead of d: p q = n,
// dp = d mod (p-1), dq = d mod (q-1), qinv q = 1 mod p. Cheap next to a
// private-key operation.
bool crt_consistent(const AttributeMap &attrs, const BIGNUM *n, const BIGNUM *d) {
    Bn p = attr_bn(attrs, TEE_ATTR_RSA_PRIME1), q = attr_bn(attrs, TEE_ATTR_RSA_PRIME2);
    Bn dp = attr_bn(attrs, TEE_ATTR_RSA_EXPONENT1), dq = attr_bn(attrs, TEE_ATTR_RSA_EXPONENT2);
    Bn qinv = attr_bn(attrs, TEE_ATTR_RSA_COEFFICIENT);
    if (BN_cmp(p.get(), BN_value_one()) <= 0 || BN_cmp(q.get(), BN_value_one()) <= 0 ||
        BN_cmp(qinv.get(), p.get()) >= 0)
        return false;
    BnCtx ctx(BN_CTX_secure_new());
    Bn t = new_bn(), pm1 = new_bn(), qm1 = new_bn();
    if (!ctx || !BN_mul(t.get(), p.get(), q.get(), ctx.get()))
        panic("the RSA backend failed");
    if (BN_cmp(t.get(), n) != 0)
        return false;
    if (!BN_sub(pm1.get(), p.get(), BN_value_one()) || !BN_sub(qm1.get(), q.get(), BN_value_one()) ||
        !BN_mod(t.get(), d, pm1.get(), ctx.get()))
        panic("the RSA backend failed");
    if (BN_cmp(t.get(), dp.get()) != 0)
        return false;
    if (!BN_mod(t.get(), d, qm1.get(), ctx.get()))
        panic("the RSA backend failed");
    if (BN_cmp(t.get(), dq.get()) != 0)
        return false;
    if (!BN_mod_mul(t.get(), qinv.get(), q.get(), p.get(), ctx.get()))
        panic("the RSA backend failed");
    return BN_is_one(t.get());
}

TEE_Result pair_key_bits(const AttributeMap &attrs, uint32_t *bits) {
    size_t crt = 0;
    for (uint32_t id : kCrtAttrs)
        crt += attrs.count(id);
    if (crt != 0 && crt != std::size(kCrtAttrs))
        panic("TEE_PopulateTransientObject with only some of the RSA CRT attributes");
    Bn n = attr_bn(attrs, TEE_ATTR_RSA_MODULUS), d = attr_bn(attrs, TEE_ATTR_RSA_PRIVATE_EXPONENT);
    uint32_t nbits = 0;
    TEE_Result res = check_public(n.get(), attr_bn(attrs, TEE_ATTR_RSA_PUBLIC_EXPONENT).get(), &nbits);
    if (res != TEE_SUCCESS)
        return res;
    if (BN_is_zero(d.get()) || BN_cmp(d.get(), n.get()) >= 0)
        return TEE_ERROR_BAD_PARAMETERS;
    // A key prepared for an operation lately passed this check when it was
    // populated then; its exact components need not pass it again.
    if (crt && !crypto_state().rsa_keys.contains(key_id(TEE_TYPE_RSA_KEYPAIR, attrs)) &&
        !crt_consistent(attrs, n.get(), d.get()))
        return TEE_ERROR_BAD_PARAMETERS;
    *bits = nbits;
    return TEE_SUCCESS;
}

// generation_exponent - *e becomes the exponent TEE_GenerateKey is asked
// for: the one reference attribute TEE_ATTR_RSA_PUBLIC_EXPONENT, or 65537.
// TEE_ERROR_BAD_PARAMETERS for any other attribute, a repeated one or an
// unusable exponent.
TEE_Result generation_exponent(const TEE_Attribute *params, uint32_t count, uint32_t bits, Bn *e) {
    *e = new_bn();
    if (!BN_set_word(e->get(), kDefaultExponent))
        panic("the RSA backend failed");
    bool seen = false;
    for (uint32_t i = 0; i < count; ++i) {
        if (params[i].attributeID != TEE_ATTR_RSA_PUBLIC_EXPONENT || seen)
            return TEE_ERROR_BAD_PARAMETERS;
        seen = true;
        const TEE_Attribute &a = params[i];
        if (a.content.ref.length && !a.content.ref.buffer)
            panic("TEE_GenerateKey with a null attribute buffer");
        *e = to_bn(static_cast<const uint8_t *>(a.content.ref.buffer), a.content.ref.length);
    }
    if (!exponent_ok(e->get(), static_cast<int>(bits)))
        return TEE_ERROR_BAD_PARAMETERS;
    return TEE_SUCCESS;
}

// pair_generate - ObjectTypeOps::generate of the key pair: all eight
// components, minimal. Key generation runs on OpenSSL's default generator,
// the same one behind TEE_GenerateRandom; bytes scripted by tests do not
// reach it.
TEE_Result pair_generate(AttributeMap &attrs, uint32_t bits, const TEE_Attribute *params, uint32_t count) {
    Bn e;
    TEE_Result res = generation_exponent(params, count, bits, &e);
    if (res != TEE_SUCCESS)
        return res;
    if (bits < kMinGenerateBits)
        return TEE_ERROR_NOT_SUPPORTED;

    ParamBld bld(OSSL_PARAM_BLD_new());
    if (!bld || !OSSL_PARAM_BLD_push_size_t(bld.get(), OSSL_PKEY_PARAM_RSA_BITS, bits) ||
        !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_RSA_E, e.get()))
        panic("the RSA backend is out of memory");
    Pkey pkey = pkey_generate("RSA", bld.get());
    for (const Component &c : kComponents)
        attrs[c.attr].bytes = from_bn(pkey_bn(pkey.get(), c.param).get());
    return TEE_SUCCESS;
}

const ObjectTypeOps kRsaTypes[] = {
    {TEE_TYPE_RSA_KEYPAIR, kPairRequired, kCrtAttrs, rsa_size_ok, pair_key_bits, pair_generate, true},
    {TEE_TYPE_RSA_PUBLIC_KEY, kPublicRequired, {}, rsa_size_ok, public_key_bits, generate_public_key, true},
};

// --- Prepared keys -----------------------------------------------------------------

// build_pkey - a new EVP_PKEY (owned by the caller) from the object's
// components, which key_bits has already checked.
EVP_PKEY *build_pkey(const Object &obj) {
    bool pair = obj.type == TEE_TYPE_RSA_KEYPAIR;
    ParamBld bld(OSSL_PARAM_BLD_new());
    if (!bld)
        panic("the RSA backend is out of memory");
    std::vector<Bn> held; // the builder refers to them until to_param
    for (const Component &c : kComponents) {
        const Attribute *a = find_attribute(obj, c.attr);
        if (!a || (c.secret && !pair))
            continue;
        held.push_back(to_bn(a->bytes));
        if (!OSSL_PARAM_BLD_push_BN(bld.get(), c.param, held.back().get()))
            panic("the RSA backend is out of memory");
    }
    EVP_PKEY *pkey = pkey_from_data("RSA", pair ? EVP_PKEY_KEYPAIR : EVP_PKEY_PUBLIC_KEY, bld.get());
    if (!pkey)
        panic("the RSA backend could not load a key");
    return pkey;
}

// prepared_key - the object's key as an EVP_PKEY, from the Tee's cache when
// a key with the same components was prepared lately. The caller owns one
// reference.
EVP_PKEY *prepared_key(const Object &obj) {
    KeyId id = key_id(obj.type, obj.attrs);
    EVP_PKEY *pkey = crypto_state().rsa_keys.get(id, [&] { return build_pkey(obj); });
    OPENSSL_cleanse(id.data(), id.size());
    return pkey;
}

// --- Operations ------------------------------------------------------------------

enum class Scheme { Pkcs1Sign, Pss, Raw, Pkcs1Encrypt, Oaep };

struct Algorithm {
    uint32_t id;
    Scheme scheme;
    uint32_t hash; // GP hash number, 0 for none
};

constexpr Algorithm kAlgorithms[] = {
    {TEE_ALG_RSASSA_PKCS1_V1_5_MD5, Scheme::Pkcs1Sign, 1},
    {TEE_ALG_RSASSA_PKCS1_V1_5_SHA1, Scheme::Pkcs1Sign, 2},
    {TEE_ALG_RSASSA_PKCS1_V1_5_SHA224, Scheme::Pkcs1Sign, 3},
    {TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, Scheme::Pkcs1Sign, 4},
    {TEE_ALG_RSASSA_PKCS1_V1_5_SHA384, Scheme::Pkcs1Sign, 5},
    {TEE_ALG_RSASSA_PKCS1_V1_5_SHA512, Scheme::Pkcs1Sign, 6},
    {TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA1, Scheme::Pss, 2},
    {TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA224, Scheme::Pss, 3},
    {TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA256, Scheme::Pss, 4},
    {TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA384, Scheme::Pss, 5},
    {TEE_ALG_RSASSA_PKCS1_PSS_MGF1_SHA512, Scheme::Pss, 6},
    {TEE_ALG_RSA_NOPAD, Scheme::Raw, 0},
    {TEE_ALG_RSAES_PKCS1_V1_5, Scheme::Pkcs1Encrypt, 0},
    // GP's OAEP identifiers and the platform's own take the same
    // construction: the named hash for the label and for MGF1.
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA1, Scheme::Oaep, 2},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA224, Scheme::Oaep, 3},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA256, Scheme::Oaep, 4},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA384, Scheme::Oaep, 5},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA512, Scheme::Oaep, 6},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA1_EXT, Scheme::Oaep, 2},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA224_EXT, Scheme::Oaep, 3},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA256_EXT, Scheme::Oaep, 4},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA384_EXT, Scheme::Oaep, 5},
    {TEE_ALG_RSAES_PKCS1_OAEP_MGF1_SHA512_EXT, Scheme::Oaep, 6},
};

// mode_fits - whether GP (or the export extension) gives the scheme that mode.
bool mode_fits(Scheme s, uint32_t mode) {
    switch (s) {
    case Scheme::Pkcs1Sign:
    case Scheme::Pss:
        return mode == TEE_MODE_SIGN || mode == TEE_MODE_VERIFY;
    case Scheme::Raw:
        return mode == TEE_MODE_ENCRYPT || mode == TEE_MODE_DECRYPT || mode == TEE_MODE_EXPORT;
    case Scheme::Pkcs1Encrypt:
    case Scheme::Oaep:
        return mode == TEE_MODE_ENCRYPT || mode == TEE_MODE_DECRYPT;
    }
    return false;
}

// usage_for - the key usage flag TEE_SetOperationKey demands for a mode.
uint32_t usage_for(uint32_t mode) {
    switch (mode) {
    case TEE_MODE_ENCRYPT:
        return TEE_USAGE_ENCRYPT;
    case TEE_MODE_DECRYPT:
        return TEE_USAGE_DECRYPT;
    case TEE_MODE_SIGN:
        return TEE_USAGE_SIGN;
    case TEE_MODE_VERIFY:
        return TEE_USAGE_VERIFY;
    default:
        return 0; // the public half is never protected by usage flags
    }
}

// operation_param - the one attribute of ID `wanted` among an operation
// call's params, or null. Any other attribute, or a repeated one, is a TA
// bug: this algorithm takes nothing else.
const TEE_Attribute *operation_param(const TEE_Attribute *params, uint32_t count, uint32_t wanted, const char *fn) {
    const TEE_Attribute *found = nullptr;
    for (uint32_t i = 0; i < count; ++i) {
        if (wanted == 0 || params[i].attributeID != wanted || found) {
            std::fprintf(stderr, "%s: attribute 0x%08x\n", fn, params[i].attributeID);
            panic("an attribute this RSA algorithm does not take, or one given twice");
        }
        found = &params[i];
    }
    if (found && !is_value_attribute(wanted) && found->content.ref.length && !found->content.ref.buffer)
        panic("an RSA operation attribute with a null buffer");
    return found;
}

class RsaEngine final : public AsymmetricEngine {
  public:
    RsaEngine(Scheme scheme, const HashInfo *hash, uint32_t mode) : scheme_(scheme), hash_(hash), mode_(mode) {}

    // Private-key modes need the private half.
    bool accepts_key(uint32_t type) const override {
        if (type == TEE_TYPE_RSA_KEYPAIR)
            return true;
        return type == TEE_TYPE_RSA_PUBLIC_KEY && mode_ != TEE_MODE_SIGN && mode_ != TEE_MODE_DECRYPT;
    }

    // Every call is complete in itself: nothing is ever in progress.
    void reset() override {}

    std::unique_ptr<Engine> clone() const override { return std::make_unique<RsaEngine>(scheme_, hash_, mode_); }

    TEE_Result encrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src, size_t src_len,
                       uint8_t *dst, uint32_t *dst_len) override;
    TEE_Result decrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src, size_t src_len,
                       uint8_t *dst, uint32_t *dst_len) override;
    TEE_Result sign_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                           size_t digest_len, uint8_t *sig, uint32_t *sig_len) override;
    TEE_Result verify_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                             size_t digest_len, const uint8_t *sig, size_t sig_len) override;
    TEE_Result export_key(Operation &op, uint32_t selector, uint8_t *out, uint32_t *len) override;

  private:
    // pss_salt - the OSSL salt-length parameter the call asks for; false
    // for a salt length no signature can have.
    bool pss_salt(const TEE_Attribute *params, uint32_t count, bool signing, const char *fn, OSSL_PARAM *out,
                  int *explicit_len) const;
    // cipher_context - a context for the key, initialised for encryption
    // or decryption with this scheme's padding and the call's label.
    PkeyCtx cipher_context(Operation &op, bool encrypting, const TEE_Attribute *label) const;
    PkeyCtx signature_context(Operation &op, bool signing, const OSSL_PARAM &salt) const;

    Scheme scheme_;
    const HashInfo *hash_;
    uint32_t mode_;
};

// modulus / operation_pkey - the operation key's n, and its prepared form
// (held by the operation's copy of the key).
const SecretBytes &modulus(const Operation &op) {
    return find_attribute(*op.key, TEE_ATTR_RSA_MODULUS)->bytes;
}

EVP_PKEY *operation_pkey(Operation &op) {
    return object_pkey(*op.key, prepared_key);
}

// context_for - a fresh context on the operation's prepared key; one per
// call, since each call may set its own padding parameters.
PkeyCtx context_for(Operation &op) {
    PkeyCtx ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, operation_pkey(op), nullptr));
    if (!ctx)
        panic("the RSA backend is out of memory");
    return ctx;
}

// as_block - the input as an integer of exactly k bytes (the modulus
// length), refused unless it is below the modulus.
bool as_block(const Operation &op, const uint8_t *src, size_t len, SecretBytes *block) {
    const SecretBytes &n = modulus(op);
    size_t k = n.size();
    if (len > k)
        return false;
    block->assign(k, 0);
    if (len)
        std::memcpy(block->data() + (k - len), src, len);
    return std::memcmp(block->data(), n.data(), k) < 0;
}

// deliver - copies a result to the caller's buffer, or reports its length.
TEE_Result deliver(const uint8_t *result, size_t len, uint8_t *dst, uint32_t *dst_len, const char *fn) {
    if (!output_fits(dst_len, len, fn))
        return TEE_ERROR_SHORT_BUFFER;
    if (len && !dst)
        panic("an RSA result into a null buffer");
    if (len)
        std::memcpy(dst, result, len);
    *dst_len = static_cast<uint32_t>(len);
    return TEE_SUCCESS;
}

PkeyCtx RsaEngine::cipher_context(Operation &op, bool encrypting, const TEE_Attribute *label) const {
    PkeyCtx ctx = context_for(op);
    OSSL_PARAM p[6];
    size_t i = 0;
    const char *pad = scheme_ == Scheme::Raw            ? OSSL_PKEY_RSA_PAD_MODE_NONE
                      : scheme_ == Scheme::Pkcs1Encrypt ? OSSL_PKEY_RSA_PAD_MODE_PKCSV15
                                                        : OSSL_PKEY_RSA_PAD_MODE_OAEP;
    p[i++] = OSSL_PARAM_construct_utf8_string(OSSL_ASYM_CIPHER_PARAM_PAD_MODE, const_cast<char *>(pad), 0);
    if (scheme_ == Scheme::Oaep) {
        char *md = const_cast<char *>(hash_->name);
        p[i++] = OSSL_PARAM_construct_utf8_string(OSSL_ASYM_CIPHER_PARAM_OAEP_DIGEST, md, 0);
        p[i++] = OSSL_PARAM_construct_utf8_string(OSSL_ASYM_CIPHER_PARAM_MGF1_DIGEST, md, 0);
        if (label && label->content.ref.length)
            p[i++] = OSSL_PARAM_construct_octet_string(OSSL_ASYM_CIPHER_PARAM_OAEP_LABEL,
                                                       const_cast<void *>(label->content.ref.buffer),
                                                       label->content.ref.length);
    }
#ifdef OSSL_ASYM_CIPHER_PARAM_IMPLICIT_REJECTION
    // A bad PKCS#1 v1.5 block is reported, not replaced by random bytes:
    // the TA maps the failure to its own error.
    unsigned int implicit_rejection = 0;
    if (scheme_ == Scheme::Pkcs1Encrypt && !encrypting)
        p[i++] = OSSL_PARAM_construct_uint(OSSL_ASYM_CIPHER_PARAM_IMPLICIT_REJECTION, &implicit_rejection);
#endif
    p[i] = OSSL_PARAM_construct_end();
    int ok = encrypting ? EVP_PKEY_encrypt_init_ex(ctx.get(), p) : EVP_PKEY_decrypt_init_ex(ctx.get(), p);
    if (ok != 1)
        panic("the RSA backend failed to start");
    return ctx;
}

TEE_Result RsaEngine::encrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src,
                              size_t src_len, uint8_t *dst, uint32_t *dst_len) {
    const char *fn = "TEE_AsymmetricEncrypt";
    const TEE_Attribute *label =
        operation_param(params, count, scheme_ == Scheme::Oaep ? TEE_ATTR_RSA_OAEP_LABEL : 0, fn);
    size_t k = modulus(op).size();
    if (scheme_ == Scheme::Raw) {
        SecretBytes block, out(k);
        if (!as_block(op, src, src_len, &block))
            return TEE_ERROR_BAD_PARAMETERS;
        PkeyCtx ctx = cipher_context(op, true, nullptr);
        size_t len = out.size();
        if (EVP_PKEY_encrypt(ctx.get(), out.data(), &len, block.data(), block.size()) != 1 || len != k)
            panic("the RSA backend failed");
        size_t zeros = 0;
        while (zeros < len && out[zeros] == 0)
            ++zeros;
        return deliver(out.data() + zeros, len - zeros, dst, dst_len, fn);
    }
    size_t overhead = scheme_ == Scheme::Pkcs1Encrypt ? 11 : 2 * size_t{hash_->size} + 2;
    if (k < overhead || src_len > k - overhead)
        return TEE_ERROR_BAD_PARAMETERS;
    if (!output_fits(dst_len, k, fn))
        return TEE_ERROR_SHORT_BUFFER;
    if (!dst)
        panic("TEE_AsymmetricEncrypt into a null buffer");
    PkeyCtx ctx = cipher_context(op, true, label);
    size_t len = *dst_len;
    if (EVP_PKEY_encrypt(ctx.get(), dst, &len, src, src_len) != 1)
        panic("the RSA backend failed");
    *dst_len = static_cast<uint32_t>(len);
    return TEE_SUCCESS;
}

TEE_Result RsaEngine::decrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src,
                              size_t src_len, uint8_t *dst, uint32_t *dst_len) {
    const char *fn = "TEE_AsymmetricDecrypt";
    const TEE_Attribute *label =
        operation_param(params, count, scheme_ == Scheme::Oaep ? TEE_ATTR_RSA_OAEP_LABEL : 0, fn);
    SecretBytes block, out(modulus(op).size());
    // A ciphertext shorter than the modulus is taken as the integer it
    // spells, as the raw operation takes its input.
    if (!as_block(op, src, src_len, &block))
        return TEE_ERROR_BAD_PARAMETERS;
    PkeyCtx ctx = cipher_context(op, false, label);
    size_t len = out.size();
    if (EVP_PKEY_decrypt(ctx.get(), out.data(), &len, block.data(), block.size()) != 1) {
        ERR_clear_error();
        return TEE_ERROR_BAD_PARAMETERS; // the padding did not check out
    }
    size_t skip = 0;
    if (scheme_ == Scheme::Raw)
        while (skip < len && out[skip] == 0)
            ++skip;
    return deliver(out.data() + skip, len - skip, dst, dst_len, fn);
}

bool RsaEngine::pss_salt(const TEE_Attribute *params, uint32_t count, bool signing, const char *fn, OSSL_PARAM *out,
                         int *explicit_len) const {
    const TEE_Attribute *a = operation_param(params, count, TEE_ATTR_RSA_PSS_SALT_LENGTH, fn);
    uint32_t v = a ? a->content.value.a : TEE_RSA_PSS_SALT_DIGEST_LENGTH;
    const char *name = nullptr;
    if (v == TEE_RSA_PSS_SALT_DIGEST_LENGTH)
        name = OSSL_PKEY_RSA_PSS_SALT_LEN_DIGEST;
    else if (v == TEE_RSA_PSS_SALT_MAX_OR_AUTO)
        name = signing ? OSSL_PKEY_RSA_PSS_SALT_LEN_MAX : OSSL_PKEY_RSA_PSS_SALT_LEN_AUTO;
    else if (v > static_cast<uint32_t>(INT_MAX))
        return false;
    if (name) {
        *out = OSSL_PARAM_construct_utf8_string(OSSL_SIGNATURE_PARAM_PSS_SALTLEN, const_cast<char *>(name), 0);
    } else {
        *explicit_len = static_cast<int>(v);
        *out = OSSL_PARAM_construct_int(OSSL_SIGNATURE_PARAM_PSS_SALTLEN, explicit_len);
    }
    return true;
}

PkeyCtx RsaEngine::signature_context(Operation &op, bool signing, const OSSL_PARAM &salt) const {
    PkeyCtx ctx = context_for(op);
    char *md = const_cast<char *>(hash_->name);
    OSSL_PARAM p[5];
    size_t i = 0;
    bool pss = scheme_ == Scheme::Pss;
    p[i++] = OSSL_PARAM_construct_utf8_string(
        OSSL_SIGNATURE_PARAM_PAD_MODE,
        const_cast<char *>(pss ? OSSL_PKEY_RSA_PAD_MODE_PSS : OSSL_PKEY_RSA_PAD_MODE_PKCSV15), 0);
    p[i++] = OSSL_PARAM_construct_utf8_string(OSSL_SIGNATURE_PARAM_DIGEST, md, 0);
    if (pss) {
        p[i++] = OSSL_PARAM_construct_utf8_string(OSSL_SIGNATURE_PARAM_MGF1_DIGEST, md, 0);
        p[i++] = salt;
    }
    p[i] = OSSL_PARAM_construct_end();
    int ok = signing ? EVP_PKEY_sign_init_ex(ctx.get(), p) : EVP_PKEY_verify_init_ex(ctx.get(), p);
    if (ok != 1)
        panic("the RSA backend failed to start");
    return ctx;
}

TEE_Result RsaEngine::sign_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                                  size_t digest_len, uint8_t *sig, uint32_t *sig_len) {
    const char *fn = "TEE_AsymmetricSignDigest";
    OSSL_PARAM salt = OSSL_PARAM_construct_end();
    int salt_len = 0;
    if (scheme_ == Scheme::Pss) {
        if (!pss_salt(params, count, true, fn, &salt, &salt_len))
            return TEE_ERROR_BAD_PARAMETERS;
    } else {
        operation_param(params, count, 0, fn);
    }
    if (digest_len != hash_->size)
        return TEE_ERROR_BAD_PARAMETERS;
    size_t k = modulus(op).size();
    if (!output_fits(sig_len, k, fn))
        return TEE_ERROR_SHORT_BUFFER;
    if (!sig)
        panic("TEE_AsymmetricSignDigest into a null buffer");
    PkeyCtx ctx = signature_context(op, true, salt);
    size_t len = *sig_len;
    if (EVP_PKEY_sign(ctx.get(), sig, &len, digest, digest_len) != 1) {
        // The digest, its encoding and the salt do not fit in the key.
        ERR_clear_error();
        return TEE_ERROR_BAD_PARAMETERS;
    }
    *sig_len = static_cast<uint32_t>(len);
    return TEE_SUCCESS;
}

TEE_Result RsaEngine::verify_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                                    size_t digest_len, const uint8_t *sig, size_t sig_len) {
    const char *fn = "TEE_AsymmetricVerifyDigest";
    OSSL_PARAM salt = OSSL_PARAM_construct_end();
    int salt_len = 0;
    if (scheme_ == Scheme::Pss) {
        if (!pss_salt(params, count, false, fn, &salt, &salt_len))
            return TEE_ERROR_BAD_PARAMETERS;
    } else {
        operation_param(params, count, 0, fn);
    }
    if (digest_len != hash_->size)
        return TEE_ERROR_BAD_PARAMETERS;
    if (sig_len != modulus(op).size())
        return TEE_ERROR_SIGNATURE_INVALID;
    PkeyCtx ctx = signature_context(op, false, salt);
    if (EVP_PKEY_verify(ctx.get(), sig, sig_len, digest, digest_len) != 1) {
        ERR_clear_error();
        return TEE_ERROR_SIGNATURE_INVALID;
    }
    return TEE_SUCCESS;
}

TEE_Result RsaEngine::export_key(Operation &op, uint32_t selector, uint8_t *out, uint32_t *len) {
    if (selector != TEE_EXPORT_RSA_PUBLIC_KEY_DER)
        return TEE_ERROR_NOT_SUPPORTED;
    EVP_PKEY *pkey = operation_pkey(op);
    int der_len = i2d_PUBKEY(pkey, nullptr);
    if (der_len <= 0)
        panic("the RSA backend failed to encode a public key");
    if (!output_fits(len, static_cast<size_t>(der_len), "TEE_AsymmetricExport"))
        return TEE_ERROR_SHORT_BUFFER;
    if (!out)
        panic("TEE_AsymmetricExport into a null buffer");
    unsigned char *p = out;
    if (i2d_PUBKEY(pkey, &p) != der_len)
        panic("the RSA backend failed to encode a public key");
    *len = static_cast<uint32_t>(der_len);
    return TEE_SUCCESS;
}

} // namespace

const ObjectTypeOps *rsa_object_type(uint32_t type) {
    return find_type(kRsaTypes, type);
}

TEE_Result rsa_setup(Operation &op) {
    const Algorithm *alg = nullptr;
    for (const auto &a : kAlgorithms)
        if (a.id == op.info.algorithm)
            alg = &a;
    if (!alg || !mode_fits(alg->scheme, op.info.mode) || !rsa_size_ok(op.info.maxKeySize))
        return TEE_ERROR_NOT_SUPPORTED;
    const HashInfo *hash = alg->hash ? hash_info(alg->hash) : nullptr;
    bool signature = alg->scheme == Scheme::Pkcs1Sign || alg->scheme == Scheme::Pss;
    op.info.digestLength = signature ? hash->size : 0;
    op.info.requiredKeyUsage = usage_for(op.info.mode);
    op.engine = std::make_unique<RsaEngine>(alg->scheme, hash, op.info.mode);
    return TEE_SUCCESS;
}

} // namespace detail
} // namespace tee_host
