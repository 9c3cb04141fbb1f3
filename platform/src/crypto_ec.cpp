/*
 * crypto_ec.cpp - ECDSA on the NIST prime curves P-192 to P-521, on
 * EVP_PKEY: the key-pair and public-key object types, key generation, and
 * signatures over a digest the caller gives, as r || s.
 *
 * A key is checked once, when it is populated: its point must lie on the
 * curve with coordinates below the field prime, and a key pair's private
 * value must be in range and give that point. Loading an EC key into
 * OpenSSL costs about as much as a signature and the checks twice as much,
 * and the TA populates the same key at every operation begin, so checked
 * keys are kept in the Tee's cache keyed by a digest of the components; a
 * key found there is neither checked nor loaded again.
 */
#include <algorithm>
#include <array>
#include <cstdio>
#include <cstring>
#include <vector>

#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/ec.h>
#include <openssl/err.h>

#include "crypto_state.h"
#include "pkey_internal.h"

namespace tee_host::detail {
namespace {

struct Curve {
    uint32_t gp;        // TEE_ECC_CURVE_*
    uint32_t bits;      // the key size
    const char *group;  // OpenSSL's name
    uint32_t algorithm; // the TEE_ALG_ECDSA_* that signs with it
};

constexpr Curve kCurves[] = {
    {TEE_ECC_CURVE_NIST_P192, 192, "P-192", TEE_ALG_ECDSA_P192},
    {TEE_ECC_CURVE_NIST_P224, 224, "P-224", TEE_ALG_ECDSA_P224},
    {TEE_ECC_CURVE_NIST_P256, 256, "P-256", TEE_ALG_ECDSA_P256},
    {TEE_ECC_CURVE_NIST_P384, 384, "P-384", TEE_ALG_ECDSA_P384},
    {TEE_ECC_CURVE_NIST_P521, 521, "P-521", TEE_ALG_ECDSA_P521},
};

constexpr size_t kMaxFieldBytes = 66;
// Room for any DER ECDSA-Sig-Value on these curves (139 bytes on P-521).
constexpr size_t kMaxDerSignature = 160;

template <class Pred> const Curve *find_curve(Pred pred) {
    for (const Curve &c : kCurves)
        if (pred(c))
            return &c;
    return nullptr;
}
const Curve *curve_by_gp(uint32_t gp) {
    return find_curve([gp](const Curve &c) { return c.gp == gp; });
}

// field_bytes - the length of a coordinate, and of each signature half.
size_t field_bytes(const Curve &c) {
    return (c.bits + 7) / 8;
}

constexpr uint32_t kPairRequired[] = {TEE_ATTR_ECC_PUBLIC_VALUE_X, TEE_ATTR_ECC_PUBLIC_VALUE_Y,
                                      TEE_ATTR_ECC_PRIVATE_VALUE, TEE_ATTR_ECC_CURVE};
constexpr uint32_t kPublicRequired[] = {TEE_ATTR_ECC_PUBLIC_VALUE_X, TEE_ATTR_ECC_PUBLIC_VALUE_Y, TEE_ATTR_ECC_CURVE};

bool ec_size_ok(uint32_t bits) {
    return find_curve([bits](const Curve &c) { return c.bits == bits; }) != nullptr;
}

// --- Checked keys ------------------------------------------------------------------

// build_checked - a new EVP_PKEY (the caller's) from components no longer
// than the curve's field, or null when they do not make a valid key: a
// point off the curve or with a coordinate not below the field prime, a
// private value outside [1, n-1], or one that does not give the point.
EVP_PKEY *build_checked(const Curve &c, const AttributeMap &attrs, bool pair) {
    size_t n = field_bytes(c);
    const SecretBytes &x = attrs.at(TEE_ATTR_ECC_PUBLIC_VALUE_X).bytes;
    const SecretBytes &y = attrs.at(TEE_ATTR_ECC_PUBLIC_VALUE_Y).bytes;
    // The uncompressed point 04 || X || Y, each coordinate left-padded.
    std::vector<uint8_t> point(1 + 2 * n, 0);
    point[0] = 0x04;
    std::copy(x.begin(), x.end(), point.begin() + 1 + (n - x.size()));
    std::copy(y.begin(), y.end(), point.end() - static_cast<std::ptrdiff_t>(y.size()));

    ParamBld bld(OSSL_PARAM_BLD_new());
    Bn d = pair ? attr_bn(attrs, TEE_ATTR_ECC_PRIVATE_VALUE) : nullptr;
    if (!bld || !OSSL_PARAM_BLD_push_utf8_string(bld.get(), OSSL_PKEY_PARAM_GROUP_NAME, c.group, 0) ||
        !OSSL_PARAM_BLD_push_octet_string(bld.get(), OSSL_PKEY_PARAM_PUB_KEY, point.data(), point.size()) ||
        (d && !OSSL_PARAM_BLD_push_BN(bld.get(), OSSL_PKEY_PARAM_PRIV_KEY, d.get())))
        panic("the EC backend is out of memory");
    Pkey pkey(pkey_from_data("EC", pair ? EVP_PKEY_KEYPAIR : EVP_PKEY_PUBLIC_KEY, bld.get()));
    bool ok = pkey != nullptr; // OpenSSL refuses a point off the curve
    if (ok) {
        // ... but takes coordinates at or above p modulo p.
        Bn p = pkey_bn(pkey.get(), OSSL_PKEY_PARAM_EC_P);
        ok = BN_cmp(to_bn(x).get(), p.get()) < 0 && BN_cmp(to_bn(y).get(), p.get()) < 0;
    }
    if (ok && pair) {
        PkeyCtx ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, pkey.get(), nullptr));
        if (!ctx)
            panic("the EC backend is out of memory");
        ok = EVP_PKEY_private_check(ctx.get()) == 1 && EVP_PKEY_pairwise_check(ctx.get()) == 1;
    }
    ERR_clear_error();
    return ok ? pkey.release() : nullptr;
}

// checked_key - a new reference to the key of these components, from the
// Tee's cache when it was checked lately, else built and checked (and then
// kept); null when the components do not make a valid key.
EVP_PKEY *checked_key(uint32_t type, const AttributeMap &attrs) {
    const Curve *c = curve_by_gp(attrs.at(TEE_ATTR_ECC_CURVE).a);
    if (!c)
        return nullptr;
    size_t n = field_bytes(*c);
    for (const auto &[id, a] : attrs)
        if (!is_value_attribute(id) && a.bytes.size() > n)
            return nullptr;
    KeyId id = key_id(type, attrs);
    EVP_PKEY *pkey =
        crypto_state().ec_keys.get(id, [&] { return build_checked(*c, attrs, type == TEE_TYPE_ECDSA_KEYPAIR); });
    OPENSSL_cleanse(id.data(), id.size());
    return pkey;
}

// --- Key objects -------------------------------------------------------------------

// key_bits - ObjectTypeOps::key_bits of both types (components already
// minimal): the curve's size, or TEE_ERROR_BAD_PARAMETERS for an unknown
// curve or an invalid key.
template <uint32_t Type> TEE_Result key_bits(const AttributeMap &attrs, uint32_t *bits) {
    EVP_PKEY *pkey = checked_key(Type, attrs);
    if (!pkey)
        return TEE_ERROR_BAD_PARAMETERS;
    EVP_PKEY_free(pkey);
    *bits = curve_by_gp(attrs.at(TEE_ATTR_ECC_CURVE).a)->bits;
    return TEE_SUCCESS;
}

// pair_generate - ObjectTypeOps::generate of the key pair. GP makes the
// curve attribute mandatory, so its absence is a TA bug and panics; a curve
// this TEE lacks is TEE_ERROR_NOT_SUPPORTED and one of another size than
// `bits` TEE_ERROR_BAD_PARAMETERS. The new key is kept prepared for the
// operations that follow. Generation runs on OpenSSL's default generator,
// as RSA's does.
TEE_Result pair_generate(AttributeMap &attrs, uint32_t bits, const TEE_Attribute *params, uint32_t count) {
    const TEE_Attribute *curve_attr = nullptr;
    for (uint32_t i = 0; i < count; ++i) {
        if (params[i].attributeID != TEE_ATTR_ECC_CURVE || curve_attr) {
            std::fprintf(stderr, "TEE_GenerateKey: attribute 0x%08x\n", params[i].attributeID);
            panic("TEE_GenerateKey with an attribute ECDSA keys do not take, or one given twice");
        }
        curve_attr = &params[i];
    }
    if (!curve_attr)
        panic("TEE_GenerateKey of an ECDSA key without TEE_ATTR_ECC_CURVE");
    const Curve *c = curve_by_gp(curve_attr->content.value.a);
    if (!c)
        return TEE_ERROR_NOT_SUPPORTED;
    if (c->bits != bits)
        return TEE_ERROR_BAD_PARAMETERS;

    ParamBld bld(OSSL_PARAM_BLD_new());
    if (!bld || !OSSL_PARAM_BLD_push_utf8_string(bld.get(), OSSL_PKEY_PARAM_GROUP_NAME, c->group, 0))
        panic("the EC backend is out of memory");
    Pkey pkey = pkey_generate("EC", bld.get());
    attrs[TEE_ATTR_ECC_PUBLIC_VALUE_X].bytes = from_bn(pkey_bn(pkey.get(), OSSL_PKEY_PARAM_EC_PUB_X).get());
    attrs[TEE_ATTR_ECC_PUBLIC_VALUE_Y].bytes = from_bn(pkey_bn(pkey.get(), OSSL_PKEY_PARAM_EC_PUB_Y).get());
    attrs[TEE_ATTR_ECC_PRIVATE_VALUE].bytes = from_bn(pkey_bn(pkey.get(), OSSL_PKEY_PARAM_PRIV_KEY).get());
    attrs[TEE_ATTR_ECC_CURVE].a = c->gp;

    KeyId id = key_id(TEE_TYPE_ECDSA_KEYPAIR, attrs);
    EVP_PKEY_free(crypto_state().ec_keys.get(id, [&] { return pkey.release(); }));
    OPENSSL_cleanse(id.data(), id.size());
    return TEE_SUCCESS;
}

const ObjectTypeOps kEcTypes[] = {
    {TEE_TYPE_ECDSA_KEYPAIR, kPairRequired, {}, ec_size_ok, key_bits<TEE_TYPE_ECDSA_KEYPAIR>, pair_generate, true},
    {TEE_TYPE_ECDSA_PUBLIC_KEY,
     kPublicRequired,
     {},
     ec_size_ok,
     key_bits<TEE_TYPE_ECDSA_PUBLIC_KEY>,
     generate_public_key,
     true},
};

// prepared_key - object_pkey's builder: the operation key, checked when it
// was populated.
EVP_PKEY *prepared_key(const Object &obj) {
    EVP_PKEY *pkey = checked_key(obj.type, obj.attrs);
    if (!pkey)
        panic("the EC backend could not load a key it had accepted");
    return pkey;
}

// --- Signatures --------------------------------------------------------------------

struct SigFree {
    void operator()(ECDSA_SIG *s) const { ECDSA_SIG_free(s); }
};
using Sig = std::unique_ptr<ECDSA_SIG, SigFree>;

class EcEngine final : public AsymmetricEngine {
  public:
    EcEngine(const Curve &curve, uint32_t mode) : curve_(curve), mode_(mode) {}
    ~EcEngine() override { EVP_PKEY_CTX_free(ctx_); }
    EcEngine(const EcEngine &) = delete;
    EcEngine &operator=(const EcEngine &) = delete;

    // Signing needs the private half; the curve must be the algorithm's.
    bool accepts_key(uint32_t type) const override {
        return type == TEE_TYPE_ECDSA_KEYPAIR || (type == TEE_TYPE_ECDSA_PUBLIC_KEY && mode_ == TEE_MODE_VERIFY);
    }
    bool accepts_key_size(uint32_t bits) const override { return bits == curve_.bits; }

    // Every call is complete in itself: nothing is ever in progress.
    void reset() override {}
    void rekey() override {
        EVP_PKEY_CTX_free(ctx_);
        ctx_ = nullptr;
    }

    std::unique_ptr<Engine> clone() const override { return std::make_unique<EcEngine>(curve_, mode_); }

    TEE_Result sign_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                           size_t digest_len, uint8_t *sig, uint32_t *sig_len) override;
    TEE_Result verify_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                             size_t digest_len, const uint8_t *sig, size_t sig_len) override;

  private:
    // context - the operation's signing or verifying context, made on first
    // use and kept until the key changes.
    EVP_PKEY_CTX *context(Operation &op);
    // backend_digest - what OpenSSL must be given to sign the integer the
    // caller means (see the definition); scratch holds field_bytes bytes.
    const uint8_t *backend_digest(Operation &op, const uint8_t *digest, size_t len, uint8_t *scratch);

    const Curve &curve_;
    uint32_t mode_;
    EVP_PKEY_CTX *ctx_ = nullptr;
};

// no_params - ECDSA takes no operation attributes; any is a TA bug.
void no_params(uint32_t count, const char *fn) {
    if (count) {
        std::fprintf(stderr, "%s\n", fn);
        panic("an attribute ECDSA does not take");
    }
}

EVP_PKEY_CTX *EcEngine::context(Operation &op) {
    if (ctx_)
        return ctx_;
    PkeyCtx ctx(EVP_PKEY_CTX_new_from_pkey(nullptr, object_pkey(*op.key, prepared_key), nullptr));
    if (!ctx || (mode_ == TEE_MODE_SIGN ? EVP_PKEY_sign_init(ctx.get()) : EVP_PKEY_verify_init(ctx.get())) != 1)
        panic("the EC backend failed to start");
    ctx_ = ctx.release();
    return ctx_;
}

// OpenSSL takes a digest longer than the key as FIPS 186 says, keeping its
// leftmost key-size bits, and that serves a digest of any length. A digest
// of exactly (key size + 7) / 8 bytes on P-521 is another matter: the TA
// cuts its digests to the key size itself, so the 66 bytes it passes are
// the integer to sign, which OpenSSL would cut a second time. Such a digest
// is taken as that integer (reduced modulo the order when it is wider than
// the key, which ECDSA does anyway) and handed to OpenSSL shifted left, so
// that OpenSSL's cut gives it back.
const uint8_t *EcEngine::backend_digest(Operation &op, const uint8_t *digest, size_t len, uint8_t *scratch) {
    size_t n = field_bytes(curve_);
    uint32_t spare = static_cast<uint32_t>(8 * n - curve_.bits); // 7 on P-521, else 0
    if (spare == 0 || len != n)
        return digest;
    if (digest[0] >> (8 - spare)) {
        Bn e = to_bn(digest, len);
        Bn order = pkey_bn(object_pkey(*op.key, prepared_key), OSSL_PKEY_PARAM_EC_ORDER);
        BnCtx bn_ctx(BN_CTX_new());
        if (!bn_ctx || !BN_nnmod(e.get(), e.get(), order.get(), bn_ctx.get()) ||
            BN_bn2binpad(e.get(), scratch, static_cast<int>(n)) != static_cast<int>(n))
            panic("the EC backend failed");
    } else {
        std::memcpy(scratch, digest, n);
    }
    for (size_t i = 0; i < n; ++i)
        scratch[i] = static_cast<uint8_t>((scratch[i] << spare) | (i + 1 < n ? scratch[i + 1] >> (8 - spare) : 0));
    return scratch;
}

TEE_Result EcEngine::sign_digest(Operation &op, const TEE_Attribute *, uint32_t count, const uint8_t *digest,
                                 size_t digest_len, uint8_t *sig, uint32_t *sig_len) {
    const char *fn = "TEE_AsymmetricSignDigest";
    no_params(count, fn);
    size_t n = field_bytes(curve_);
    if (!output_fits(sig_len, 2 * n, fn))
        return TEE_ERROR_SHORT_BUFFER;
    if (!sig)
        panic("TEE_AsymmetricSignDigest into a null buffer");
    std::array<uint8_t, kMaxFieldBytes> scratch{};
    const uint8_t *in = backend_digest(op, digest, digest_len, scratch.data());
    uint8_t der[kMaxDerSignature] = {};
    size_t der_len = sizeof der;
    if (EVP_PKEY_sign(context(op), der, &der_len, in, digest_len) != 1)
        panic("the EC backend failed to sign");
    const uint8_t *p = der;
    Sig s(d2i_ECDSA_SIG(nullptr, &p, static_cast<long>(der_len)));
    int half = static_cast<int>(n);
    if (!s || BN_bn2binpad(ECDSA_SIG_get0_r(s.get()), sig, half) != half ||
        BN_bn2binpad(ECDSA_SIG_get0_s(s.get()), sig + n, half) != half)
        panic("the EC backend made a signature it cannot read");
    *sig_len = static_cast<uint32_t>(2 * n);
    return TEE_SUCCESS;
}

TEE_Result EcEngine::verify_digest(Operation &op, const TEE_Attribute *, uint32_t count, const uint8_t *digest,
                                   size_t digest_len, const uint8_t *sig, size_t sig_len) {
    no_params(count, "TEE_AsymmetricVerifyDigest");
    size_t n = field_bytes(curve_);
    if (sig_len != 2 * n)
        return TEE_ERROR_SIGNATURE_INVALID;
    // OpenSSL verifies the DER form: r and s are re-encoded as it wants them.
    Sig s(ECDSA_SIG_new());
    Bn r(BN_bin2bn(sig, static_cast<int>(n), nullptr)), sv(BN_bin2bn(sig + n, static_cast<int>(n), nullptr));
    if (!s || !r || !sv || ECDSA_SIG_set0(s.get(), r.get(), sv.get()) != 1)
        panic("the EC backend is out of memory");
    r.release(); // now owned by s
    sv.release();
    uint8_t der[kMaxDerSignature] = {};
    int der_len = i2d_ECDSA_SIG(s.get(), nullptr);
    uint8_t *p = der;
    if (der_len <= 0 || static_cast<size_t>(der_len) > sizeof der || i2d_ECDSA_SIG(s.get(), &p) != der_len)
        panic("the EC backend failed to encode a signature");
    std::array<uint8_t, kMaxFieldBytes> scratch{};
    const uint8_t *in = backend_digest(op, digest, digest_len, scratch.data());
    int ok = EVP_PKEY_verify(context(op), der, static_cast<size_t>(der_len), in, digest_len);
    ERR_clear_error();
    // Anything but a clear yes, an error included, is a signature refused.
    return ok == 1 ? TEE_SUCCESS : TEE_ERROR_SIGNATURE_INVALID;
}

} // namespace

const ObjectTypeOps *ec_object_type(uint32_t type) {
    return find_type(kEcTypes, type);
}

TEE_Result ec_setup(Operation &op) {
    uint32_t alg = op.info.algorithm, mode = op.info.mode;
    const Curve *c = find_curve([alg](const Curve &x) { return x.algorithm == alg; });
    if (!c || (mode != TEE_MODE_SIGN && mode != TEE_MODE_VERIFY) || op.info.maxKeySize != c->bits)
        return TEE_ERROR_NOT_SUPPORTED;
    op.info.requiredKeyUsage = mode == TEE_MODE_SIGN ? TEE_USAGE_SIGN : TEE_USAGE_VERIFY;
    op.engine = std::make_unique<EcEngine>(*c, mode);
    return TEE_SUCCESS;
}

} // namespace tee_host::detail
