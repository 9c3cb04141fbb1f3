/*
 * The platform's EC: ECDSA key objects on the five NIST curves, their
 * generation and the checks made when they are populated; signatures over
 * digests of any length, as r || s, checked against OpenSSL called directly
 * in both directions; the full-width P-521 digest; the prepared-key cache;
 * and the panics on misuse.
 */
#include <memory>
#include <random>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/param_build.h>

#include "gp_handles.h"

namespace {

class Ec : public TeeTest {};
using EcDeathTest = Ec;

struct Curve {
    uint32_t gp;
    uint32_t bits;
    uint32_t alg;
    const char *group;
    size_t n() const { return (bits + 7) / 8; } // bytes of a coordinate, and of a signature half
};

const Curve kCurves[] = {
    {TEE_ECC_CURVE_NIST_P192, 192, TEE_ALG_ECDSA_P192, "P-192"},
    {TEE_ECC_CURVE_NIST_P224, 224, TEE_ALG_ECDSA_P224, "P-224"},
    {TEE_ECC_CURVE_NIST_P256, 256, TEE_ALG_ECDSA_P256, "P-256"},
    {TEE_ECC_CURVE_NIST_P384, 384, TEE_ALG_ECDSA_P384, "P-384"},
    {TEE_ECC_CURVE_NIST_P521, 521, TEE_ALG_ECDSA_P521, "P-521"},
};
const Curve &kP256 = kCurves[2];
const Curve &kP521 = kCurves[4];

// --- OpenSSL on its own --------------------------------------------------------------

struct PkeyFree {
    void operator()(EVP_PKEY *k) const { EVP_PKEY_free(k); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;
struct BnFree {
    void operator()(BIGNUM *b) const { BN_free(b); }
};
using Bn = std::unique_ptr<BIGNUM, BnFree>;

Bn bn(const Bytes &b) {
    return Bn(BN_bin2bn(b.data(), static_cast<int>(b.size()), nullptr));
}

Bytes bn_bytes(const BIGNUM *v, size_t pad = 0) {
    Bytes out(pad ? pad : static_cast<size_t>(BN_num_bytes(v)));
    BN_bn2binpad(v, out.data(), static_cast<int>(out.size()));
    return out;
}

Bytes key_param(EVP_PKEY *k, const char *name) {
    BIGNUM *v = nullptr;
    EXPECT_EQ(EVP_PKEY_get_bn_param(k, name, &v), 1) << name;
    Bn owned(v);
    return bn_bytes(v);
}

// The components of an EC key as the platform takes them: minimal
// big-endian X, Y and private value D.
struct Components {
    Bytes x, y, d;
};

Components components_of(EVP_PKEY *k) {
    return {key_param(k, OSSL_PKEY_PARAM_EC_PUB_X), key_param(k, OSSL_PKEY_PARAM_EC_PUB_Y),
            key_param(k, OSSL_PKEY_PARAM_PRIV_KEY)};
}

Pkey ossl_generate(const Curve &c) {
    return Pkey(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", c.group));
}

// ossl_public - an OpenSSL public key from the platform's coordinates.
Pkey ossl_public(const Curve &c, const Bytes &x, const Bytes &y) {
    Bytes point(1 + 2 * c.n(), 0);
    point[0] = 4;
    std::copy(x.begin(), x.end(), point.begin() + 1 + (c.n() - x.size()));
    std::copy(y.begin(), y.end(), point.end() - static_cast<std::ptrdiff_t>(y.size()));
    OSSL_PARAM params[] = {OSSL_PARAM_construct_utf8_string(OSSL_PKEY_PARAM_GROUP_NAME, const_cast<char *>(c.group), 0),
                           OSSL_PARAM_construct_octet_string(OSSL_PKEY_PARAM_PUB_KEY, point.data(), point.size()),
                           OSSL_PARAM_construct_end()};
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_name(nullptr, "EC", nullptr);
    EVP_PKEY *k = nullptr;
    EXPECT_EQ(EVP_PKEY_fromdata_init(ctx), 1);
    EXPECT_EQ(EVP_PKEY_fromdata(ctx, &k, EVP_PKEY_PUBLIC_KEY, params), 1);
    EVP_PKEY_CTX_free(ctx);
    return Pkey(k);
}

// der_of / raw_of - an ECDSA-Sig-Value from r || s, and back.
Bytes der_of(const Bytes &raw) {
    size_t n = raw.size() / 2;
    ECDSA_SIG *s = ECDSA_SIG_new();
    ECDSA_SIG_set0(s, BN_bin2bn(raw.data(), static_cast<int>(n), nullptr),
                   BN_bin2bn(raw.data() + n, static_cast<int>(n), nullptr));
    Bytes der(static_cast<size_t>(i2d_ECDSA_SIG(s, nullptr)));
    unsigned char *p = der.data();
    i2d_ECDSA_SIG(s, &p);
    ECDSA_SIG_free(s);
    return der;
}

Bytes raw_of(const Bytes &der, size_t n) {
    const unsigned char *p = der.data();
    ECDSA_SIG *s = d2i_ECDSA_SIG(nullptr, &p, static_cast<long>(der.size()));
    EXPECT_NE(s, nullptr);
    Bytes raw = bn_bytes(ECDSA_SIG_get0_r(s), n);
    Bytes half = bn_bytes(ECDSA_SIG_get0_s(s), n);
    raw.insert(raw.end(), half.begin(), half.end());
    ECDSA_SIG_free(s);
    return raw;
}

bool ossl_verify(EVP_PKEY *k, const Bytes &digest, const Bytes &raw) {
    Bytes der = der_of(raw);
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_pkey(nullptr, k, nullptr);
    bool ok = EVP_PKEY_verify_init(ctx) == 1 &&
              EVP_PKEY_verify(ctx, der.data(), der.size(), digest.data(), digest.size()) == 1;
    EVP_PKEY_CTX_free(ctx);
    ERR_clear_error();
    return ok;
}

Bytes ossl_sign(EVP_PKEY *k, const Bytes &digest) {
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_pkey(nullptr, k, nullptr);
    Bytes der(200);
    size_t len = der.size();
    EXPECT_EQ(EVP_PKEY_sign_init(ctx), 1);
    EXPECT_EQ(EVP_PKEY_sign(ctx, der.data(), &len, digest.data(), digest.size()), 1);
    EVP_PKEY_CTX_free(ctx);
    der.resize(len);
    return der;
}

// --- Platform keys and signatures ---------------------------------------------------

std::vector<TEE_Attribute> pair_attrs(const Components &k, uint32_t curve) {
    return {ref_attr(TEE_ATTR_ECC_PUBLIC_VALUE_X, k.x), ref_attr(TEE_ATTR_ECC_PUBLIC_VALUE_Y, k.y),
            ref_attr(TEE_ATTR_ECC_PRIVATE_VALUE, k.d), value_attr(TEE_ATTR_ECC_CURVE, curve)};
}

std::vector<TEE_Attribute> public_attrs(const Components &k, uint32_t curve) {
    return {ref_attr(TEE_ATTR_ECC_PUBLIC_VALUE_X, k.x), ref_attr(TEE_ATTR_ECC_PUBLIC_VALUE_Y, k.y),
            value_attr(TEE_ATTR_ECC_CURVE, curve)};
}

// A key-pair object holding k, or a public-key object holding its point.
std::unique_ptr<Obj> pair_object(const Curve &c, const Components &k) {
    auto o = std::make_unique<Obj>(TEE_TYPE_ECDSA_KEYPAIR, c.bits);
    EXPECT_EQ(o->populate(pair_attrs(k, c.gp)), TEE_SUCCESS) << c.group;
    return o;
}
std::unique_ptr<Obj> public_object(const Curve &c, const Components &k) {
    auto o = std::make_unique<Obj>(TEE_TYPE_ECDSA_PUBLIC_KEY, c.bits);
    EXPECT_EQ(o->populate(public_attrs(k, c.gp)), TEE_SUCCESS) << c.group;
    return o;
}

std::unique_ptr<Obj> generated(const Curve &c) {
    auto o = std::make_unique<Obj>(TEE_TYPE_ECDSA_KEYPAIR, c.bits);
    TEE_Attribute curve = value_attr(TEE_ATTR_ECC_CURVE, c.gp);
    EXPECT_EQ(TEE_GenerateKey(*o, c.bits, &curve, 1), TEE_SUCCESS) << c.group;
    return o;
}

Components read_back(const Obj &o) {
    return {o.buffer(TEE_ATTR_ECC_PUBLIC_VALUE_X), o.buffer(TEE_ATTR_ECC_PUBLIC_VALUE_Y),
            o.buffer(TEE_ATTR_ECC_PRIVATE_VALUE)};
}

TEE_Result sign(const Curve &c, TEE_ObjectHandle key, const Bytes &digest, Bytes *sig) {
    Op op(c.alg, TEE_MODE_SIGN, c.bits, key);
    sig->assign(2 * c.n(), 0);
    uint32_t len = u32(sig->size());
    TEE_Result res = TEE_AsymmetricSignDigest(op, nullptr, 0, digest.data(), u32(digest.size()), sig->data(), &len);
    EXPECT_EQ(len, 2 * c.n());
    return res;
}

TEE_Result verify(const Curve &c, TEE_ObjectHandle key, const Bytes &digest, const Bytes &sig) {
    Op op(c.alg, TEE_MODE_VERIFY, c.bits, key);
    return TEE_AsymmetricVerifyDigest(op, nullptr, 0, digest.data(), u32(digest.size()), sig.data(), u32(sig.size()));
}

Bytes flipped(Bytes b, size_t byte, uint8_t mask = 0x01) {
    b[byte] ^= mask;
    return b;
}

// --- Keys ----------------------------------------------------------------------------

TEST_F(Ec, GeneratedKeysOnEveryCurveSignAndVerify) {
    std::mt19937 rng(521);
    for (const Curve &c : kCurves) {
        auto key = generated(c);
        TEE_ObjectInfo info = key->info();
        EXPECT_EQ(info.objectType, TEE_TYPE_ECDSA_KEYPAIR);
        EXPECT_EQ(info.objectSize, c.bits);
        uint32_t a = 0, b = 0;
        ASSERT_EQ(TEE_GetObjectValueAttribute(*key, TEE_ATTR_ECC_CURVE, &a, &b), TEE_SUCCESS);
        EXPECT_EQ(a, c.gp);
        Components k = read_back(*key);
        for (const Bytes *v : {&k.x, &k.y, &k.d}) {
            ASSERT_FALSE(v->empty());
            EXPECT_LE(v->size(), c.n()) << c.group;
            EXPECT_NE((*v)[0], 0) << c.group << ": read back without leading zeros";
        }

        Bytes digest = random_bytes(rng, 32), sig, again;
        ASSERT_EQ(sign(c, *key, digest, &sig), TEE_SUCCESS);
        ASSERT_EQ(sign(c, *key, digest, &again), TEE_SUCCESS);
        EXPECT_NE(sig, again) << "a fresh nonce for every signature";
        // The point read back is the generated key's, as OpenSSL sees it.
        Pkey ossl = ossl_public(c, k.x, k.y);
        EXPECT_TRUE(ossl_verify(ossl.get(), digest, sig)) << c.group;
        auto pub = public_object(c, k);
        for (TEE_ObjectHandle v : {key->h, pub->h}) {
            EXPECT_EQ(verify(c, v, digest, sig), TEE_SUCCESS) << c.group;
            EXPECT_EQ(verify(c, v, digest, again), TEE_SUCCESS) << c.group;
            EXPECT_EQ(verify(c, v, flipped(digest, 0), sig), TEE_ERROR_SIGNATURE_INVALID) << c.group;
            EXPECT_EQ(verify(c, v, digest, flipped(sig, 0, 0x80)), TEE_ERROR_SIGNATURE_INVALID) << c.group;
            EXPECT_EQ(verify(c, v, digest, flipped(sig, c.n() + 5)), TEE_ERROR_SIGNATURE_INVALID) << c.group;
            EXPECT_EQ(verify(c, v, digest, flipped(sig, sig.size() - 1)), TEE_ERROR_SIGNATURE_INVALID);
            Bytes shorter(sig.begin() + 1, sig.end()), longer = sig;
            longer.insert(longer.begin(), 0);
            EXPECT_EQ(verify(c, v, digest, shorter), TEE_ERROR_SIGNATURE_INVALID) << c.group;
            EXPECT_EQ(verify(c, v, digest, longer), TEE_ERROR_SIGNATURE_INVALID) << c.group;
            EXPECT_EQ(verify(c, v, digest, Bytes(sig.size(), 0)), TEE_ERROR_SIGNATURE_INVALID) << c.group;
        }
    }
}

TEST_F(Ec, SignaturesInterworkWithOpenSslForDigestsOfAnyLength) {
    std::mt19937 rng(186);
    for (const Curve &c : kCurves) {
        Pkey ossl = ossl_generate(c);
        Components k = components_of(ossl.get());
        auto pair = pair_object(c, k);
        auto pub = public_object(c, k);
        for (size_t len : {0, 1, 20, 28, 32, 48, 64, 65, 80}) {
            Bytes digest = random_bytes(rng, len), sig;
            ASSERT_EQ(sign(c, *pair, digest, &sig), TEE_SUCCESS);
            EXPECT_TRUE(ossl_verify(ossl.get(), digest, sig)) << c.group << " digest of " << len;
            Bytes theirs = raw_of(ossl_sign(ossl.get(), digest), c.n());
            EXPECT_EQ(verify(c, *pub, digest, theirs), TEE_SUCCESS) << c.group << " digest of " << len;
            EXPECT_EQ(verify(c, *pair, digest, theirs), TEE_SUCCESS) << c.group << " digest of " << len;
            EXPECT_EQ(verify(c, *pub, digest, flipped(theirs, 3, 0x10)), TEE_ERROR_SIGNATURE_INVALID);
        }
    }
}

// The TA cuts a digest longer than the key to its leftmost key-size bits
// itself; on P-521 it hands the platform 66 bytes holding a 521-bit
// integer, which must be signed as it is, not cut a second time.
TEST_F(Ec, AFullWidthP521DigestIsTheIntegerItSpells) {
    std::mt19937 rng(7);
    Pkey ossl = ossl_generate(kP521);
    Components k = components_of(ossl.get());
    auto pair = pair_object(kP521, k);
    for (int round = 0; round < 4; ++round) {
        // A 66-byte message, cut as FIPS 186 says: shifted right by 7 bits.
        Bytes message = random_bytes(rng, 66);
        message[0] |= 0x80;
        Bn cut = bn(message);
        BN_rshift(cut.get(), cut.get(), 7);
        Bytes ta_digest = bn_bytes(cut.get(), 66);
        Bytes sig;
        ASSERT_EQ(sign(kP521, *pair, ta_digest, &sig), TEE_SUCCESS);
        EXPECT_TRUE(ossl_verify(ossl.get(), message, sig)) << "the cut digest signs the message";
        EXPECT_EQ(verify(kP521, *pair, ta_digest, sig), TEE_SUCCESS);
        EXPECT_EQ(verify(kP521, *pair, message, sig), TEE_ERROR_SIGNATURE_INVALID) << "the uncut bytes differ";
    }
    // 66 bytes wider than the key: the integer, reduced modulo the order as
    // ECDSA does with any wide integer.
    Bytes wide(66, 0xFF), sig;
    ASSERT_EQ(sign(kP521, *pair, wide, &sig), TEE_SUCCESS);
    BIGNUM *order = nullptr;
    ASSERT_EQ(EVP_PKEY_get_bn_param(ossl.get(), OSSL_PKEY_PARAM_EC_ORDER, &order), 1);
    Bn owned(order), e = bn(wide);
    BN_CTX *ctx = BN_CTX_new();
    ASSERT_EQ(BN_nnmod(e.get(), e.get(), order, ctx), 1);
    BN_CTX_free(ctx);
    BN_lshift(e.get(), e.get(), 7); // what OpenSSL cuts back to e mod n
    EXPECT_TRUE(ossl_verify(ossl.get(), bn_bytes(e.get(), 66), sig));
    EXPECT_EQ(verify(kP521, *pair, wide, sig), TEE_SUCCESS);
}

TEST_F(Ec, SignReportsAShortBufferWithTheSizeNeeded) {
    for (const Curve &c : {kP256, kP521}) {
        auto key = generated(c);
        Op op(c.alg, TEE_MODE_SIGN, c.bits, *key);
        Bytes digest(32, 9), sig(2 * c.n());
        uint32_t len = u32(sig.size() - 1);
        EXPECT_EQ(TEE_AsymmetricSignDigest(op, nullptr, 0, digest.data(), 32, sig.data(), &len),
                  TEE_ERROR_SHORT_BUFFER);
        EXPECT_EQ(len, 2 * c.n());
        len = 0;
        EXPECT_EQ(TEE_AsymmetricSignDigest(op, nullptr, 0, digest.data(), 32, nullptr, &len), TEE_ERROR_SHORT_BUFFER);
        EXPECT_EQ(len, 2 * c.n());
        ASSERT_EQ(TEE_AsymmetricSignDigest(op, nullptr, 0, digest.data(), 32, sig.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(verify(c, *key, digest, sig), TEE_SUCCESS);
    }
}

TEST_F(Ec, PopulateRefusesWhatIsNotAValidKeyAndLeavesTheObjectEmpty) {
    Pkey ossl = ossl_generate(kP256);
    Components good = components_of(ossl.get());
    BIGNUM *order = nullptr;
    ASSERT_EQ(EVP_PKEY_get_bn_param(ossl.get(), OSSL_PKEY_PARAM_EC_ORDER, &order), 1);
    Bn n(order), d_plus_one = bn(good.d);
    BN_add_word(d_plus_one.get(), 1);

    struct Case {
        const char *what;
        Components k;
        uint32_t curve = TEE_ECC_CURVE_NIST_P256;
        bool pair_only = false;
    };
    Components off = good, zero_d = good, d_n = good, other_d = good, long_d = good, long_x = good;
    off.y.back() ^= 1;
    zero_d.d = {0};
    d_n.d = bn_bytes(n.get());
    other_d.d = bn_bytes(d_plus_one.get());
    long_d.d.insert(long_d.d.begin(), 1);
    long_x.x.insert(long_x.x.begin(), 1);
    const Case cases[] = {
        {"point off the curve", off},
        {"coordinate longer than the field", long_x},
        {"private value 0", zero_d, TEE_ECC_CURVE_NIST_P256, true},
        {"private value n", d_n, TEE_ECC_CURVE_NIST_P256, true},
        {"private value of another key", other_d, TEE_ECC_CURVE_NIST_P256, true},
        {"private value longer than the field", long_d, TEE_ECC_CURVE_NIST_P256, true},
        {"unknown curve", good, 0},
        {"unknown curve", good, 6},
        {"another curve", good, TEE_ECC_CURVE_NIST_P224},
        {"a larger curve than the object", good, TEE_ECC_CURVE_NIST_P384},
    };
    tee_host::PreparedKeyStats before = tee_host::ec_cache::stats();
    for (const Case &c : cases) {
        for (bool pair : {true, false}) {
            if (c.pair_only && !pair)
                continue;
            Obj o(pair ? TEE_TYPE_ECDSA_KEYPAIR : TEE_TYPE_ECDSA_PUBLIC_KEY, 256);
            EXPECT_EQ(o.populate(pair ? pair_attrs(c.k, c.curve) : public_attrs(c.k, c.curve)),
                      TEE_ERROR_BAD_PARAMETERS)
                << c.what << (pair ? " (pair)" : " (public)");
            EXPECT_EQ(o.info().handleFlags, 0u) << c.what;
            // The object can still take a valid key.
            EXPECT_EQ(o.populate(pair ? pair_attrs(good, kP256.gp) : public_attrs(good, kP256.gp)), TEE_SUCCESS);
        }
    }
    EXPECT_EQ(tee_host::ec_cache::stats().size, std::min<size_t>(before.size + 2, 8)) << "only valid keys are kept";

    // OpenSSL takes a coordinate at or above the field prime modulo the
    // prime; the platform does not. P-521's prime leaves room for X + p.
    Pkey big = ossl_generate(kP521);
    Components k521 = components_of(big.get());
    BIGNUM *p = nullptr;
    ASSERT_EQ(EVP_PKEY_get_bn_param(big.get(), OSSL_PKEY_PARAM_EC_P, &p), 1);
    Bn prime(p), x = bn(k521.x);
    BN_add(x.get(), x.get(), prime.get());
    Components shifted = k521;
    shifted.x = bn_bytes(x.get());
    ASSERT_LE(shifted.x.size(), kP521.n());
    Obj o(TEE_TYPE_ECDSA_PUBLIC_KEY, 521);
    EXPECT_EQ(o.populate(public_attrs(shifted, kP521.gp)), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_EQ(o.populate(public_attrs(k521, kP521.gp)), TEE_SUCCESS);
}

TEST_F(Ec, ComponentsReadBackMinimalWhateverFormTheyCameIn) {
    // Keys whose coordinates or private value are shorter than the field,
    // given left-padded to the field: the object holds the integers.
    int seen = 0;
    for (int tries = 0; tries < 3000 && seen < 3; ++tries) {
        Pkey ossl = ossl_generate(kP256);
        Components k = components_of(ossl.get());
        if (k.x.size() == 32 && k.y.size() == 32 && k.d.size() == 32)
            continue;
        ++seen;
        Components padded = k;
        for (Bytes *v : {&padded.x, &padded.y, &padded.d})
            v->insert(v->begin(), 32 - v->size() + 1, 0); // and one zero byte beyond the field
        auto pair = std::make_unique<Obj>(TEE_TYPE_ECDSA_KEYPAIR, 256);
        ASSERT_EQ(pair->populate(pair_attrs(padded, kP256.gp)), TEE_SUCCESS);
        Components back = read_back(*pair);
        EXPECT_EQ(back.x, k.x);
        EXPECT_EQ(back.y, k.y);
        EXPECT_EQ(back.d, k.d);
        Bytes sig, digest(32, 0x5A);
        ASSERT_EQ(sign(kP256, *pair, digest, &sig), TEE_SUCCESS);
        EXPECT_TRUE(ossl_verify(ossl.get(), digest, sig));
    }
    EXPECT_EQ(seen, 3) << "no short component in 3000 keys";

    // GP's sizing: too small a buffer reports the length, the shortest form's.
    auto key = generated(kP521);
    Bytes x = key->buffer(TEE_ATTR_ECC_PUBLIC_VALUE_X), out(66);
    uint32_t len = u32(x.size() - 1);
    EXPECT_EQ(TEE_GetObjectBufferAttribute(*key, TEE_ATTR_ECC_PUBLIC_VALUE_X, out.data(), &len),
              TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, x.size());
}

TEST_F(Ec, GenerationTakesExactlyTheCurveOfTheRequestedSize) {
    for (uint32_t bits : {192u, 224u, 256u, 384u, 521u}) {
        Obj o(TEE_TYPE_ECDSA_KEYPAIR, bits);
        EXPECT_EQ(o.info().maxObjectSize, bits);
    }
    for (uint32_t type : {TEE_TYPE_ECDSA_KEYPAIR, TEE_TYPE_ECDSA_PUBLIC_KEY}) {
        for (uint32_t bits : {0u, 160u, 255u, 257u, 512u, 528u}) {
            TEE_ObjectHandle h = TEE_HANDLE_NULL;
            EXPECT_EQ(TEE_AllocateTransientObject(type, bits, &h), TEE_ERROR_NOT_SUPPORTED) << bits;
            EXPECT_EQ(h, nullptr);
        }
    }
    Obj o(TEE_TYPE_ECDSA_KEYPAIR, 384);
    TEE_Attribute p256 = value_attr(TEE_ATTR_ECC_CURVE, TEE_ECC_CURVE_NIST_P256);
    TEE_Attribute unknown = value_attr(TEE_ATTR_ECC_CURVE, 0x42);
    EXPECT_EQ(TEE_GenerateKey(o, 384, &p256, 1), TEE_ERROR_BAD_PARAMETERS) << "a curve of another size";
    EXPECT_EQ(TEE_GenerateKey(o, 384, &unknown, 1), TEE_ERROR_NOT_SUPPORTED);
    EXPECT_EQ(TEE_GenerateKey(o, 300, &p256, 1), TEE_ERROR_NOT_SUPPORTED);
    EXPECT_EQ(TEE_GenerateKey(o, 521, &p256, 1), TEE_ERROR_BAD_PARAMETERS) << "above the object's maximum";
    EXPECT_EQ(o.info().handleFlags, 0u);
    ASSERT_EQ(TEE_GenerateKey(o, 256, &p256, 1), TEE_SUCCESS) << "a smaller curve than the maximum";
    EXPECT_EQ(o.info().objectSize, 256u);
    Obj pub(TEE_TYPE_ECDSA_PUBLIC_KEY, 256);
    EXPECT_EQ(TEE_GenerateKey(pub, 256, &p256, 1), TEE_ERROR_NOT_SUPPORTED) << "GP generates key pairs";
}

// --- Operations ----------------------------------------------------------------------

TEST_F(Ec, OperationsAllocateOnlyForTheirCurveAndSignatureModes) {
    for (const Curve &c : kCurves) {
        for (uint32_t mode : {TEE_MODE_SIGN, TEE_MODE_VERIFY}) {
            Op op(c.alg, mode, c.bits);
            TEE_OperationInfo info = op.info();
            EXPECT_EQ(info.operationClass, TEE_OPERATION_ASYMMETRIC_SIGNATURE);
            EXPECT_EQ(info.requiredKeyUsage, mode == TEE_MODE_SIGN ? TEE_USAGE_SIGN : TEE_USAGE_VERIFY);
        }
        for (uint32_t mode : {TEE_MODE_ENCRYPT, TEE_MODE_DECRYPT, TEE_MODE_DIGEST, TEE_MODE_EXPORT}) {
            TEE_OperationHandle h = TEE_HANDLE_NULL;
            EXPECT_EQ(TEE_AllocateOperation(&h, c.alg, mode, c.bits), TEE_ERROR_NOT_SUPPORTED) << c.group;
        }
        for (uint32_t bits : {c.bits - 1, c.bits + 1, 521u == c.bits ? 384u : 521u}) {
            TEE_OperationHandle h = TEE_HANDLE_NULL;
            EXPECT_EQ(TEE_AllocateOperation(&h, c.alg, TEE_MODE_SIGN, bits), TEE_ERROR_NOT_SUPPORTED) << c.group;
        }
    }
}

TEST_F(Ec, ACopiedOperationSignsWithTheSameKey) {
    auto key = generated(kP256);
    Op a(kP256.alg, TEE_MODE_SIGN, 256, *key), b(kP256.alg, TEE_MODE_SIGN, 256);
    TEE_CopyOperation(b, a);
    Bytes digest(32, 3), sig(64);
    uint32_t len = 64;
    ASSERT_EQ(TEE_AsymmetricSignDigest(b, nullptr, 0, digest.data(), 32, sig.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(verify(kP256, *key, digest, sig), TEE_SUCCESS);
}

// --- The prepared-key cache ----------------------------------------------------------

std::vector<uint64_t> counts() {
    tee_host::PreparedKeyStats s = tee_host::ec_cache::stats();
    return {s.hits, s.misses, s.size};
}

TEST_F(Ec, CheckedKeysAreKeptByTheirComponentsAndTheCacheStaysBounded) {
    Pkey a = ossl_generate(kP256);
    Components ka = components_of(a.get());
    EXPECT_EQ(counts(), (std::vector<uint64_t>{0, 0, 0}));
    {
        auto first = pair_object(kP256, ka);
        EXPECT_EQ(counts(), (std::vector<uint64_t>{0, 1, 1})) << "checked and kept at populate";
        // The same key populated again, as the TA does at every begin, even
        // with a leading zero byte: found, not checked again.
        Components padded = ka;
        padded.x.insert(padded.x.begin(), 0);
        auto second = pair_object(kP256, padded);
        EXPECT_EQ(counts(), (std::vector<uint64_t>{1, 1, 1}));
        Bytes digest(32, 1), sig;
        ASSERT_EQ(sign(kP256, *second, digest, &sig), TEE_SUCCESS);
        EXPECT_EQ(counts(), (std::vector<uint64_t>{2, 1, 1})) << "the operation finds the key prepared";
        EXPECT_TRUE(ossl_verify(a.get(), digest, sig));
        // Its public half is another key.
        auto pub = public_object(kP256, ka);
        EXPECT_EQ(counts(), (std::vector<uint64_t>{2, 2, 2}));
    }

    // Ten more keys through an eight-entry cache, least recently used out
    // first; every one of them still signs.
    std::vector<Components> keys;
    for (int i = 0; i < 10; ++i) {
        Pkey k = ossl_generate(kP256);
        keys.push_back(components_of(k.get()));
        auto o = pair_object(kP256, keys.back());
        Bytes sig;
        ASSERT_EQ(sign(kP256, *o, Bytes(32, 2), &sig), TEE_SUCCESS);
        EXPECT_TRUE(ossl_verify(k.get(), Bytes(32, 2), sig));
    }
    EXPECT_EQ(counts(), (std::vector<uint64_t>{12, 12, 8}));
    auto recent = pair_object(kP256, keys.back());
    EXPECT_EQ(counts(), (std::vector<uint64_t>{13, 12, 8}));
    auto evicted = pair_object(kP256, ka);
    EXPECT_EQ(counts(), (std::vector<uint64_t>{13, 13, 8})) << "key A was evicted and is checked anew";
}

// --- Misuse --------------------------------------------------------------------------

TEST_F(EcDeathTest, MisusePanics) {
    auto p224 = generated(kCurves[1]);
    auto p256 = generated(kP256);
    auto pub = public_object(kP256, read_back(*p256));
    Key aes(TEE_TYPE_AES, Bytes(16, 1));
    Bytes buf(132);
    uint32_t len = u32(buf.size());

    Op signer(kP256.alg, TEE_MODE_SIGN, 256);
    EXPECT_DEATH(TEE_SetOperationKey(signer, *p224), "wrong size for the algorithm");
    EXPECT_DEATH(TEE_SetOperationKey(signer, *pub), "wrong type");
    EXPECT_DEATH(TEE_SetOperationKey(signer, aes), "wrong type");
    EXPECT_DEATH(TEE_AsymmetricSignDigest(signer, nullptr, 0, buf.data(), 32, buf.data(), &len),
                 "before its key was set");
    ASSERT_EQ(TEE_SetOperationKey(signer, *p256), TEE_SUCCESS);
    TEE_Attribute extra = value_attr(TEE_ATTR_ECC_CURVE, kP256.gp);
    EXPECT_DEATH(TEE_AsymmetricSignDigest(signer, &extra, 1, buf.data(), 32, buf.data(), &len), "does not take");
    EXPECT_DEATH(TEE_AsymmetricSignDigest(signer, nullptr, 0, buf.data(), 32, nullptr, &len), "null buffer");
    EXPECT_DEATH(TEE_AsymmetricVerifyDigest(signer, nullptr, 0, buf.data(), 32, buf.data(), 64), "wrong mode");

    Obj o(TEE_TYPE_ECDSA_KEYPAIR, 256);
    EXPECT_DEATH(TEE_GenerateKey(o, 256, nullptr, 0), "without TEE_ATTR_ECC_CURVE");
    TEE_Attribute twice[] = {extra, extra};
    EXPECT_DEATH(TEE_GenerateKey(o, 256, twice, 2), "given twice");
    Components k = read_back(*p256);
    std::vector<TEE_Attribute> missing = public_attrs(k, kP256.gp);
    EXPECT_DEATH(o.populate(missing), "mandatory attribute");
    std::vector<TEE_Attribute> foreign = pair_attrs(k, kP256.gp);
    foreign.push_back(ref_attr(TEE_ATTR_SECRET_VALUE, k.d));
    EXPECT_DEATH(o.populate(foreign), "foreign to the object type");
}

} // namespace
