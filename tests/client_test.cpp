/*
 * The client library beyond the names: key parameters as text, the
 * PKCS#8 and public-key conversions, and the key and operation calls'
 * wire shapes over a scripted transport and over the embedded TEE.
 */
#include <algorithm>
#include <cstring>
#include <deque>
#include <functional>
#include <stdexcept>
#include <filesystem>
#include <memory>

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/encoder.h>
#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include <gtest/gtest.h>

#include "keymaster_defs.h"
#include "km/client.h"
#include "km/embedded_tee.h"
#include "km/key_material.h"
#include "km/param_text.h"
#include "ta_entry.h"
#include "ta_fixture.h"
#include "scratch_dir.h"

namespace {

using km::Param;
using km::ParamSet;

// ---- parameters as text ----

TEST(ParamText, EachTagTypeReadsItsValue) {
    struct Case {
        const char *text;
        uint32_t tag;
        uint64_t value;
        Bytes bytes;
    };
    const Case cases[] = {
        {"KM_TAG_PURPOSE=sign", KM_TAG_PURPOSE, KM_PURPOSE_SIGN, {}},
        {"purpose=VERIFY", KM_TAG_PURPOSE, KM_PURPOSE_VERIFY, {}},
        {"digest=sha256", KM_TAG_DIGEST, KM_DIGEST_SHA_2_256, {}},
        {"KM_TAG_PADDING=5", KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN, {}},
        {"block-mode=gcm", KM_TAG_BLOCK_MODE, KM_MODE_GCM, {}},
        {"algorithm=hmac", KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC, {}},
        {"key-size=256", KM_TAG_KEY_SIZE, 256, {}},
        {"KM_TAG_KEY_SIZE=0x100", KM_TAG_KEY_SIZE, 256, {}},
        {"min_mac_length=4294967295", KM_TAG_MIN_MAC_LENGTH, 4294967295u, {}},
        {"RSA_PUBLIC_EXPONENT=65537", KM_TAG_RSA_PUBLIC_EXPONENT, 65537, {}},
        {"user-secure-id=18446744073709551615", KM_TAG_USER_SECURE_ID, UINT64_MAX, {}},
        {"ACTIVE_DATETIME=2026-01-31T12:00:00Z", KM_TAG_ACTIVE_DATETIME, 1769860800000u, {}},
        {"usage-expire-datetime=1700000000123", KM_TAG_USAGE_EXPIRE_DATETIME, 1700000000123u, {}},
        {"NO_AUTH_REQUIRED", KM_TAG_NO_AUTH_REQUIRED, 1, {}},
        {"caller-nonce", KM_TAG_CALLER_NONCE, 1, {}},
        {"APPLICATION_ID=616263", KM_TAG_APPLICATION_ID, 0, {0x61, 0x62, 0x63}},
        {"KM_TAG_NONCE=00FFaa", KM_TAG_NONCE, 0, {0x00, 0xFF, 0xAA}},
        {"APPLICATION_DATA=", KM_TAG_APPLICATION_DATA, 0, {}},
        // A tag number with known type bits, for tags without a name.
        {"0x30000BB8=7", 0x30000BB8u, 7, {}},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.text);
        std::string why;
        std::optional<Param> p = km::parse_param(c.text, &why);
        ASSERT_TRUE(p) << why;
        EXPECT_EQ(p->tag, c.tag);
        EXPECT_EQ(p->value, c.value);
        EXPECT_EQ(p->bytes, c.bytes);
    }
}

TEST(ParamText, RefusalsSayWhatIsWrong) {
    struct Case {
        const char *text;
        const char *reason; // a part of the message
    };
    const Case cases[] = {
        {"KM_TAG_BOGUS=1", "unknown tag 'KM_TAG_BOGUS'"},
        {"=1", "unknown tag"},
        {"0xB0000001=1", "unknown tag"},
        {"NO_AUTH_REQUIRED=1", "KM_TAG_NO_AUTH_REQUIRED is a boolean and takes no value"},
        {"NO_AUTH_REQUIRED=", "takes no value"},
        {"KEY_SIZE", "KM_TAG_KEY_SIZE needs a value"},
        {"KEY_SIZE=", "bad value '' for KM_TAG_KEY_SIZE"},
        {"KEY_SIZE=abc", "expected a 32-bit unsigned number"},
        {"KEY_SIZE=4294967296", "expected a 32-bit unsigned number"},
        {"KEY_SIZE=-1", "bad value '-1'"},
        {"RSA_PUBLIC_EXPONENT=18446744073709551616", "64-bit"},
        {"PURPOSE=sideways", "expected one of encrypt, decrypt, sign, verify or a number"},
        {"DIGEST=sha3", "bad value 'sha3' for KM_TAG_DIGEST"},
        {"PURPOSE=4294967296", "bad value"},
        {"APPLICATION_ID=abc", "expected hex bytes"},
        {"APPLICATION_ID=zz", "expected hex bytes"},
        {"ACTIVE_DATETIME=2026-02-30", "ISO 8601"},
        {"ACTIVE_DATETIME=2026-01-31T12:00:00", "bad value"},
        {"ACTIVE_DATETIME=tomorrow", "bad value"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.text);
        std::string why;
        EXPECT_FALSE(km::parse_param(c.text, &why));
        EXPECT_NE(why.find(c.reason), std::string::npos) << why;
    }
}

TEST(ParamText, DatesInUtcRoundTrip) {
    const std::pair<const char *, uint64_t> exact[] = {
        {"1970-01-01T00:00:00Z", 0},
        {"2000-02-29T00:00:00Z", 951782400000u},
        {"2024-02-29T23:59:59Z", 1709251199000u},
        {"2026-01-31T12:00:00Z", 1769860800000u},
        {"2026-01-31T12:00:00.250Z", 1769860800250u},
        {"9999-12-31T23:59:59Z", 253402300799000u},
    };
    for (const auto &[text, ms] : exact) {
        SCOPED_TRACE(text);
        EXPECT_EQ(km::parse_date(text), ms);
        EXPECT_EQ(km::format_date(ms), text);
    }
    EXPECT_EQ(km::parse_date("2026-01-31"), 1769817600000u) << "a date alone is its midnight";
    EXPECT_EQ(km::parse_date("42"), 42u);
    // Past year 9999 the number itself is printed, and it parses back.
    EXPECT_EQ(km::format_date(UINT64_MAX), std::to_string(UINT64_MAX));
    EXPECT_EQ(km::parse_date(km::format_date(UINT64_MAX)), UINT64_MAX);
    for (const char *bad : {"", "2023-02-29", "2100-02-29", "2026-13-01", "2026-00-10", "2026-04-31", "1969-12-31",
                            "2026-01-31T24:00:00Z", "2026-01-31T12:60:00Z", "2026-01-31T12:00:60Z", "2026-01-31T12:00Z",
                            "2026-01-31T12:00:00+01:00", "2026-01-31T12:00:00.5Z", "2026-01-31 12:00:00Z", "26-01-31",
                            "2026-1-31", "2026-01-31T12:00:00ZZ", "-5"})
        EXPECT_EQ(km::parse_date(bad), std::nullopt) << bad;
}

TEST(ParamText, HexBothWays) {
    EXPECT_EQ(km::parse_hex("00ff7Fa0"), (Bytes{0x00, 0xFF, 0x7F, 0xA0}));
    EXPECT_EQ(km::parse_hex(""), Bytes{});
    for (const char *bad : {"0", "0g", "0x00", " 00", "00 "})
        EXPECT_EQ(km::parse_hex(bad), std::nullopt) << bad;
    EXPECT_EQ(km::to_hex(Bytes{0x00, 0xAB, 0x10}), "00ab10");
}

TEST(ParamText, ValuesPrintByTypeAndNeverShowBytes) {
    struct Case {
        Param param;
        const char *text;
    };
    const Case cases[] = {
        {{KM_TAG_PURPOSE, KM_PURPOSE_DECRYPT, {}}, "decrypt"},
        {{KM_TAG_DIGEST, KM_DIGEST_SHA_2_512, {}}, "sha_2_512"},
        {{KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED, {}}, "imported"},
        {{KM_TAG_PADDING, 99, {}}, "99"},
        {{KM_TAG_KEY_SIZE, 2048, {}}, "2048"},
        {{KM_TAG_USER_SECURE_ID, UINT64_MAX, {}}, "18446744073709551615"},
        {{KM_TAG_ACTIVE_DATETIME, 1769860800000u, {}}, "2026-01-31T12:00:00Z"},
        {{KM_TAG_NO_AUTH_REQUIRED, 1, {}}, "true"},
        {{KM_TAG_APPLICATION_ID, 0, {'s', 'e', 'c'}}, "3 bytes"},
        {{KM_TAG_NONCE, 0, {7}}, "1 byte"},
    };
    for (const Case &c : cases)
        EXPECT_EQ(km::param_value_text(c.param), c.text) << km::tag_name(c.param.tag);
}

TEST(ParamText, OnlyRepeatableTagsMayRepeat) {
    ParamSet ok;
    ok.add(KM_TAG_PURPOSE, 2).add(KM_TAG_PURPOSE, 3).add(KM_TAG_DIGEST, 4).add(KM_TAG_DIGEST, 6);
    ok.add(KM_TAG_USER_SECURE_ID, 1).add(KM_TAG_USER_SECURE_ID, 2).add(KM_TAG_KEY_SIZE, 256);
    EXPECT_EQ(km::repeated_single_tag(ok), std::nullopt);
    ParamSet twice = ok;
    twice.add(KM_TAG_MIN_MAC_LENGTH, 128).add(KM_TAG_KEY_SIZE, 128);
    EXPECT_EQ(km::repeated_single_tag(twice), KM_TAG_KEY_SIZE);
    ParamSet bools;
    bools.add_bool(KM_TAG_NO_AUTH_REQUIRED).add_bool(KM_TAG_NO_AUTH_REQUIRED);
    EXPECT_EQ(km::repeated_single_tag(bools), KM_TAG_NO_AUTH_REQUIRED);
}

// ---- PKCS#8 and public keys ----

struct PkeyFree {
    void operator()(EVP_PKEY *p) const { EVP_PKEY_free(p); }
    void operator()(BIO *p) const { BIO_free(p); }
    void operator()(BIGNUM *p) const { BN_free(p); }
    void operator()(BN_CTX *p) const { BN_CTX_free(p); }
};
using Pkey = std::unique_ptr<EVP_PKEY, PkeyFree>;
using Bn = std::unique_ptr<BIGNUM, PkeyFree>;

Bytes pkcs8_der(EVP_PKEY *key) {
    PKCS8_PRIV_KEY_INFO *info = EVP_PKEY2PKCS8(key);
    unsigned char *der = nullptr;
    int n = i2d_PKCS8_PRIV_KEY_INFO(info, &der);
    PKCS8_PRIV_KEY_INFO_free(info);
    Bytes out(der, der + (n > 0 ? n : 0));
    OPENSSL_free(der);
    return out;
}

Bytes bio_bytes(BIO *bio) {
    char *data = nullptr;
    long n = BIO_get_mem_data(bio, &data);
    return Bytes(data, data + n);
}

Bytes pkcs8_pem(EVP_PKEY *key) {
    std::unique_ptr<BIO, PkeyFree> bio(BIO_new(BIO_s_mem()));
    EXPECT_EQ(PEM_write_bio_PKCS8PrivateKey(bio.get(), key, nullptr, nullptr, 0, nullptr, nullptr), 1);
    return bio_bytes(bio.get());
}

Bytes spki_der(EVP_PKEY *key) {
    unsigned char *der = nullptr;
    int n = i2d_PUBKEY(key, &der);
    Bytes out(der, der + (n > 0 ? n : 0));
    OPENSSL_free(der);
    return out;
}

// Splits a run of u32-length-prefixed fields starting at pos; every byte must be used.
std::vector<Bytes> fields(const Bytes &in, size_t pos) {
    std::vector<Bytes> out;
    while (pos < in.size()) {
        EXPECT_GE(in.size() - pos, 4u);
        if (in.size() - pos < 4)
            break;
        uint32_t n = km::get_u32(in.data() + pos);
        pos += 4;
        EXPECT_GE(in.size() - pos, n);
        if (in.size() - pos < n)
            break;
        out.emplace_back(in.begin() + static_cast<long>(pos), in.begin() + static_cast<long>(pos + n));
        pos += n;
    }
    return out;
}

Bn bn(const Bytes &b) {
    return Bn(BN_bin2bn(b.data(), static_cast<int>(b.size()), nullptr));
}

TEST(KeyMaterial, RsaComponentsInTheirOrder) {
    Pkey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{2048}));
    ASSERT_TRUE(key);
    std::string why;
    std::optional<Bytes> from_der = km::rsa_import_material(pkcs8_der(key.get()), &why);
    ASSERT_TRUE(from_der) << why;
    std::optional<Bytes> from_pem = km::rsa_import_material(pkcs8_pem(key.get()), &why);
    ASSERT_TRUE(from_pem) << why;
    EXPECT_EQ(*from_der, *from_pem);

    std::vector<Bytes> f = fields(*from_der, 0);
    ASSERT_EQ(f.size(), 8u);
    EXPECT_EQ(f[0].size(), 256u) << "n of a 2048-bit key";
    EXPECT_NE(f[0][0], 0) << "no sign byte";
    EXPECT_EQ(f[1], (Bytes{0x01, 0x00, 0x01}));
    // The order is held to the arithmetic, not to a second reading of the key.
    Bn n = bn(f[0]), e = bn(f[1]), d = bn(f[2]), p = bn(f[3]), q = bn(f[4]), dp = bn(f[5]), dq = bn(f[6]),
       qinv = bn(f[7]);
    std::unique_ptr<BN_CTX, PkeyFree> ctx(BN_CTX_new());
    Bn t(BN_new()), pm1(BN_dup(p.get())), qm1(BN_dup(q.get()));
    BN_sub_word(pm1.get(), 1);
    BN_sub_word(qm1.get(), 1);
    ASSERT_EQ(BN_mul(t.get(), p.get(), q.get(), ctx.get()), 1);
    EXPECT_EQ(BN_cmp(t.get(), n.get()), 0) << "n = p q";
    ASSERT_EQ(BN_mod(t.get(), d.get(), pm1.get(), ctx.get()), 1);
    EXPECT_EQ(BN_cmp(t.get(), dp.get()), 0) << "dp = d mod (p - 1)";
    ASSERT_EQ(BN_mod(t.get(), d.get(), qm1.get(), ctx.get()), 1);
    EXPECT_EQ(BN_cmp(t.get(), dq.get()), 0) << "dq = d mod (q - 1)";
    ASSERT_EQ(BN_mod_mul(t.get(), qinv.get(), q.get(), p.get(), ctx.get()), 1);
    EXPECT_TRUE(BN_is_one(t.get())) << "qinv q = 1 mod p";
    ASSERT_EQ(BN_mod_mul(t.get(), e.get(), d.get(), pm1.get(), ctx.get()), 1);
    EXPECT_TRUE(BN_is_one(t.get())) << "e d = 1 mod (p - 1)";
}

// A private key as OpenSSL's encoders write it: output "PEM" or "DER",
// structure "PrivateKeyInfo" (PKCS#8), "EncryptedPrivateKeyInfo" (with
// pass) or "type-specific" (PKCS#1, SEC 1).
Bytes encoded(EVP_PKEY *key, const char *output, const char *structure, const char *pass = nullptr) {
    std::unique_ptr<OSSL_ENCODER_CTX, decltype(&OSSL_ENCODER_CTX_free)> ctx(
        OSSL_ENCODER_CTX_new_for_pkey(key, OSSL_KEYMGMT_SELECT_KEYPAIR, output, structure, nullptr),
        &OSSL_ENCODER_CTX_free);
    EXPECT_TRUE(ctx && OSSL_ENCODER_CTX_get_num_encoders(ctx.get()) > 0) << output << " " << structure;
    if (pass) {
        EXPECT_EQ(OSSL_ENCODER_CTX_set_cipher(ctx.get(), "AES-256-CBC", nullptr), 1);
        EXPECT_EQ(OSSL_ENCODER_CTX_set_passphrase(ctx.get(), reinterpret_cast<const unsigned char *>(pass),
                                                  std::strlen(pass)),
                  1);
    }
    unsigned char *data = nullptr;
    size_t len = 0;
    EXPECT_EQ(OSSL_ENCODER_to_data(ctx.get(), &data, &len), 1);
    Bytes out(data, data + len);
    OPENSSL_free(data);
    return out;
}

km::Passphrase passphrase(const char *text, int *asked) {
    return [text, asked]() -> std::optional<std::string> {
        ++*asked;
        if (!text)
            return std::nullopt;
        return std::string(text);
    };
}

// Every default form OpenSSL writes gives the same material; the passphrase
// is asked for only when the key is encrypted.
TEST(KeyMaterial, EveryFormOpenSslWritesGivesTheSameMaterial) {
    for (const char *algorithm : {"RSA", "EC"}) {
        SCOPED_TRACE(algorithm);
        const bool rsa = std::strcmp(algorithm, "RSA") == 0;
        Pkey key(rsa ? EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{1024})
                     : EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
        ASSERT_TRUE(key);
        auto convert = [rsa](const Bytes &in, const km::Passphrase &pass, std::string *why) {
            return rsa ? km::rsa_import_material(in, pass, why) : km::ec_import_material(in, pass, why);
        };
        std::string why;
        int asked = 0;
        const std::optional<Bytes> reference = convert(pkcs8_der(key.get()), passphrase(nullptr, &asked), &why);
        ASSERT_TRUE(reference) << why;
        const std::pair<const char *, Bytes> plain[] = {
            {"PKCS#8 PEM", encoded(key.get(), "PEM", "PrivateKeyInfo")},
            {"traditional PEM", encoded(key.get(), "PEM", "type-specific")},
            {"traditional DER", encoded(key.get(), "DER", "type-specific")},
        };
        for (const auto &[form, bytes] : plain) {
            SCOPED_TRACE(form);
            EXPECT_EQ(convert(bytes, passphrase(nullptr, &asked), &why), reference) << why;
        }
        EXPECT_EQ(asked, 0) << "asked for the passphrase of a plain key";
        for (const char *output : {"PEM", "DER"}) {
            SCOPED_TRACE(output);
            const Bytes encrypted = encoded(key.get(), output, "EncryptedPrivateKeyInfo", "secret");
            asked = 0;
            EXPECT_EQ(convert(encrypted, passphrase("secret", &asked), &why), reference) << why;
            EXPECT_GE(asked, 1);
            EXPECT_FALSE(convert(encrypted, passphrase("wrong", &asked), &why));
            EXPECT_EQ(why, "the passphrase does not decrypt the key");
            EXPECT_FALSE(convert(encrypted, passphrase(nullptr, &asked), &why));
            EXPECT_EQ(why, "the key is encrypted: give its passphrase with --passin");
        }
    }
}

TEST(KeyMaterial, RsaRefusesWhatIsNotAnRsaPrivateKey) {
    Pkey rsa(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{1024}));
    Pkey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    ASSERT_TRUE(rsa && ec);
    Bytes der = pkcs8_der(rsa.get());
    Bytes trailing = der;
    trailing.push_back(0);
    const Bytes truncated(der.begin(), der.end() - 1);
    const std::string text = "not a key at all";
    const Bytes public_only = spki_der(rsa.get());

    struct Case {
        const char *what;
        Bytes input;
        const char *reason;
    };
    const Case cases[] = {
        {"an EC key", encoded(ec.get(), "PEM", "type-specific"), "not an RSA key"},
        {"a public key", public_only, "not a private key"},
        {"truncated DER", truncated, "not a private key"},
        {"trailing byte", trailing, "bytes follow the DER key"},
        {"text", Bytes(text.begin(), text.end()), "not a private key"},
        {"empty", {}, "empty"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        std::string why;
        EXPECT_FALSE(km::rsa_import_material(c.input, &why));
        EXPECT_NE(why.find(c.reason), std::string::npos) << why;
    }
}

TEST(KeyMaterial, EcImportAndExportMeetTheOriginalKey) {
    const std::pair<const char *, uint32_t> curves[] = {{"P-256", 256}, {"P-384", 384}, {"P-521", 521}};
    for (const auto &[curve, bits] : curves) {
        SCOPED_TRACE(curve);
        Pkey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", curve));
        ASSERT_TRUE(key);
        std::string why;
        std::optional<Bytes> material = km::ec_import_material(pkcs8_pem(key.get()), &why);
        ASSERT_TRUE(material) << why;
        EXPECT_EQ(km::get_u32(material->data()), bits);
        std::vector<Bytes> f = fields(*material, 4);
        ASSERT_EQ(f.size(), 3u);
        for (const Bytes &v : f)
            EXPECT_EQ(v.size(), (bits + 7) / 8) << "padded to the field size";

        // What the TA exports is the material without the private value.
        Bytes exported(material->begin(), material->end() - 4 - static_cast<long>(f[2].size()));
        std::optional<Bytes> der = km::public_key_der(KM_ALGORITHM_EC, exported, &why);
        ASSERT_TRUE(der) << why;
        EXPECT_EQ(*der, spki_der(key.get()));
    }

    Pkey key(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    std::string why;
    Bytes material = km::ec_import_material(pkcs8_der(key.get()), &why).value_or(Bytes{});
    ASSERT_EQ(material.size(), 4 + 3 * 36u);
    Bytes exported(material.begin(), material.begin() + 4 + 2 * 36);
    Bytes off_curve = exported;
    off_curve.back() ^= 1;
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_EC, off_curve, &why));
    EXPECT_NE(why.find("not on its curve"), std::string::npos) << why;
    Bytes wrong_size = exported;
    wrong_size[0] = 0x01; // 257 bits
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_EC, wrong_size, &why));
    EXPECT_NE(why.find("unknown size 257"), std::string::npos) << why;
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_EC, Bytes(exported.begin(), exported.end() - 1), &why));
    EXPECT_NE(why.find("truncated"), std::string::npos) << why;

    Pkey x25519(EVP_PKEY_Q_keygen(nullptr, nullptr, "X25519"));
    EXPECT_FALSE(km::ec_import_material(pkcs8_der(x25519.get()), &why));
    EXPECT_NE(why.find("not an EC key"), std::string::npos) << why;
    Pkey k1(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "secp256k1"));
    EXPECT_FALSE(km::ec_import_material(pkcs8_der(k1.get()), &why));
    EXPECT_NE(why.find("P-192"), std::string::npos) << why;
}

TEST(KeyMaterial, RsaExportIsCheckedAndPassedOn) {
    Pkey rsa(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{1024}));
    Pkey ec(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", "P-256"));
    std::string why;
    Bytes spki = spki_der(rsa.get());
    EXPECT_EQ(km::public_key_der(KM_ALGORITHM_RSA, spki, &why), spki);
    Bytes cut(spki.begin(), spki.end() - 1);
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_RSA, cut, &why));
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_RSA, spki_der(ec.get()), &why));
    EXPECT_FALSE(km::public_key_der(KM_ALGORITHM_HMAC, spki, &why));
    EXPECT_NE(why.find("only RSA and EC"), std::string::npos);
}

TEST(KeyMaterial, PemArmourReadsBack) {
    Pkey rsa(EVP_PKEY_Q_keygen(nullptr, nullptr, "RSA", size_t{2048}));
    Bytes spki = spki_der(rsa.get());
    std::string pem = km::pem_encode("PUBLIC KEY", spki);
    EXPECT_EQ(pem.rfind("-----BEGIN PUBLIC KEY-----\n", 0), 0u);
    EXPECT_EQ(pem.substr(pem.size() - 25), "-----END PUBLIC KEY-----\n");
    size_t start = 0;
    while (start < pem.size()) {
        size_t end = pem.find('\n', start);
        ASSERT_NE(end, std::string::npos);
        EXPECT_LE(end - start, 64u);
        start = end + 1;
    }
    std::unique_ptr<BIO, PkeyFree> bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    Pkey back(PEM_read_bio_PUBKEY(bio.get(), nullptr, nullptr, nullptr));
    ASSERT_TRUE(back);
    EXPECT_EQ(spki_der(back.get()), spki);
    EXPECT_EQ(km::pem_encode("X", {}), "-----BEGIN X-----\n-----END X-----\n");
}

// ---- the key and operation calls over a scripted transport ----

// Answers each invoke from a script and records the whole request.
class Script : public km::Transport {
  public:
    struct Sent {
        uint32_t cmd, types, a, b;
        Bytes request;             // params[1], when given
        uint32_t out_capacity = 0; // params[2].memref.size, when given
    };
    struct Answer {
        TEE_Result res = TEE_SUCCESS;
        uint32_t a = 0, b = 0;
        Bytes out;
        std::optional<uint32_t> out_size; // default: out.size()
    };
    TEE_Result open() override { return TEE_SUCCESS; }
    void close() override {}
    TEE_Result invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) override {
        Sent s{cmd, types, params[0].value.a, params[0].value.b, {}, 0};
        if (TEE_PARAM_TYPE_GET(types, 1) == TEE_PARAM_TYPE_MEMREF_INPUT) {
            auto *p = static_cast<const uint8_t *>(params[1].memref.buffer);
            s.request.assign(p, p + params[1].memref.size);
        }
        const bool out = TEE_PARAM_TYPE_GET(types, 2) == TEE_PARAM_TYPE_MEMREF_OUTPUT;
        if (out)
            s.out_capacity = params[2].memref.size;
        sent.push_back(s);
        if (answers.empty()) {
            ADD_FAILURE() << "unexpected command " << cmd;
            return TEE_ERROR_GENERIC;
        }
        Answer ans = answers.front();
        answers.pop_front();
        params[0].value.a = ans.a;
        params[0].value.b = ans.b;
        if (out) {
            size_t n = std::min<size_t>(ans.out.size(), params[2].memref.size);
            std::copy(ans.out.begin(), ans.out.begin() + static_cast<long>(n),
                      static_cast<uint8_t *>(params[2].memref.buffer));
            params[2].memref.size = ans.out_size.value_or(static_cast<uint32_t>(ans.out.size()));
        }
        return ans.res;
    }
    std::deque<Answer> answers;
    std::vector<Sent> sent;
};

Bytes lv(const Bytes &b) {
    Bytes out;
    km::put_lv(out, b);
    return out;
}

Bytes cat(std::initializer_list<Bytes> parts) {
    Bytes out;
    for (const Bytes &p : parts)
        out.insert(out.end(), p.begin(), p.end());
    return out;
}

constexpr uint32_t kIo = 0x0653;
constexpr uint32_t kIn = 0x0053;
constexpr uint32_t kValueOnly = 0x0003;

TEST(ClientKeyWire, GenerateAndImport) {
    ParamSet params;
    params.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add(KM_TAG_KEY_SIZE, 256);
    ParamSet chars = params;
    chars.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    const Bytes blob = {1, 2, 3, 4, 5};

    Script t;
    t.answers = {{TEE_SUCCESS, 0, 0, blob, {}}, {TEE_SUCCESS, 0, 0, cat({lv(blob), lv(chars.serialize())}), {}}};
    km::Client client(t);
    km::Result<Bytes> generated = client.generate_key(params);
    ASSERT_TRUE(generated.ok()) << km::describe(generated.status);
    EXPECT_EQ(generated.value, blob) << "trimmed to what the TA wrote";
    const Bytes material = {9, 9, 9};
    km::Result<km::ImportedKey> imported = client.import_key(params, material);
    ASSERT_TRUE(imported.ok()) << km::describe(imported.status);
    EXPECT_EQ(imported.value.blob, blob);
    EXPECT_EQ(imported.value.characteristics.serialize(), chars.serialize());

    ASSERT_EQ(t.sent.size(), 2u);
    EXPECT_EQ(t.sent[0].cmd, KM_CMD_GENERATE_KEY);
    EXPECT_EQ(t.sent[0].types, kIo);
    EXPECT_EQ(t.sent[0].request, params.serialize());
    EXPECT_EQ(t.sent[0].out_capacity, km::kBlobCapacity);
    EXPECT_EQ(t.sent[1].cmd, KM_CMD_IMPORT_KEY);
    EXPECT_EQ(t.sent[1].types, kIo);
    EXPECT_EQ(t.sent[1].request, cat({lv(params.serialize()), material}));
}

TEST(ClientKeyWire, MalformedImportAnswersAreTeeFailures) {
    ParamSet chars;
    chars.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    const Bytes blob = {1, 2, 3};
    const Bytes good = cat({lv(blob), lv(chars.serialize())});
    struct Case {
        const char *what;
        Bytes out;
    };
    const Case cases[] = {
        {"blob length past the end", Bytes{0xFF, 0, 0, 0, 1}},
        {"no characteristics length", lv(blob)},
        {"characteristics length past the end", Bytes(good.begin(), good.end() - 1)},
        {"bytes after the characteristics", cat({good, Bytes{0}})},
        {"characteristics not a whole set", cat({lv(blob), lv(cat({chars.serialize(), Bytes{0}}))})},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, c.out, {}}};
        km::Client client(t);
        km::Result<km::ImportedKey> r = client.import_key(ParamSet{}, Bytes{1});
        EXPECT_EQ(r.status.tee, TEE_ERROR_BAD_FORMAT);
        EXPECT_TRUE(r.value.blob.empty());
    }
    Script t;
    t.answers = {{TEE_SUCCESS, 0, 0, {}, 0xFFFFu}};
    km::Client client(t);
    EXPECT_EQ(client.generate_key(ParamSet{}).status.tee, TEE_ERROR_BAD_FORMAT) << "a size beyond the buffer";
}

TEST(ClientKeyWire, KeyReferenceCommands) {
    const km::KeyReference key{{0xB1, 0xB2}, {'i', 'd'}, {'d'}};
    const Bytes reference = cat({lv(key.blob), lv(key.app_id), lv(key.app_data)});
    ParamSet chars;
    chars.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add_bytes(KM_TAG_NONCE, Bytes{1, 2});
    const Bytes serialized = chars.serialize();

    Script t;
    t.answers = {{TEE_SUCCESS, 0, static_cast<uint32_t>(serialized.size()), {}, {}},
                 {TEE_SUCCESS, 0, 0, serialized, {}},
                 {TEE_SUCCESS, 0, 0, Bytes{0x30, 0x00}, {}},
                 {TEE_SUCCESS, 0, 0, {}, {}},
                 {TEE_SUCCESS, 0, 0, {}, {}}};
    km::Client client(t);
    km::Result<ParamSet> got = client.characteristics(key);
    ASSERT_TRUE(got.ok()) << km::describe(got.status);
    EXPECT_EQ(got.value.serialize(), serialized);
    EXPECT_EQ(client.export_key(key).value, (Bytes{0x30, 0x00}));
    EXPECT_TRUE(client.delete_key(key.blob).ok());
    EXPECT_TRUE(client.delete_all_keys().ok());

    ASSERT_EQ(t.sent.size(), 5u);
    EXPECT_EQ(t.sent[0].cmd, KM_CMD_GET_KEY_CHARACTER_SIZE);
    EXPECT_EQ(t.sent[0].types, kIn);
    EXPECT_EQ(t.sent[0].request, reference);
    EXPECT_EQ(t.sent[1].cmd, KM_CMD_GET_KEY_CHARACTER);
    EXPECT_EQ(t.sent[1].types, kIo);
    EXPECT_EQ(t.sent[1].request, reference);
    EXPECT_EQ(t.sent[1].out_capacity, serialized.size()) << "exactly the announced size";
    EXPECT_EQ(t.sent[2].cmd, KM_CMD_EXPORT_KEY);
    EXPECT_EQ(t.sent[2].request, reference);
    EXPECT_EQ(t.sent[3].cmd, KM_CMD_DELETE_KEY);
    EXPECT_EQ(t.sent[3].types, kIn);
    EXPECT_EQ(t.sent[3].request, key.blob) << "the bare blob, no length";
    EXPECT_EQ(t.sent[4].cmd, KM_CMD_DELETE_ALL_KEY);
    EXPECT_EQ(t.sent[4].types, kValueOnly);

    {
        SCOPED_TRACE("a refused size query stops there");
        Script r;
        r.answers = {{TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_INVALID_KEY_BLOB), 0, {}, {}}};
        km::Client c(r);
        km::Result<ParamSet> refused = c.characteristics(key);
        EXPECT_EQ(refused.status.km, KM_ERROR_INVALID_KEY_BLOB);
        EXPECT_EQ(r.sent.size(), 1u);
    }
    {
        SCOPED_TRACE("an absurd size is not turned into an allocation");
        Script r;
        r.answers = {{TEE_SUCCESS, 0, 0x7FFFFFFFu, {}, {}}};
        km::Client c(r);
        EXPECT_EQ(c.characteristics(key).status.tee, TEE_ERROR_BAD_FORMAT);
        EXPECT_EQ(r.sent.size(), 1u);
    }
}

TEST(ClientOperationWire, BeginUpdateFinishAbort) {
    ParamSet begin_params;
    begin_params.add(KM_TAG_MAC_LENGTH, 256);
    ParamSet begin_out;
    begin_out.add_bytes(KM_TAG_NONCE, Bytes(12, 7));
    ParamSet finish_out;
    const Bytes blob = {0xAA, 0xBB};
    const Bytes input(100, 0x55);
    const Bytes signature = {1, 2, 3, 4};

    Script t;
    t.answers = {{TEE_SUCCESS, 0, 0x1234, begin_out.serialize(), {}},
                 {TEE_SUCCESS, 0, 60, Bytes(16, 0xEE), {}},
                 {TEE_SUCCESS, 0, 0, cat({lv(Bytes{9, 8}), lv(finish_out.serialize())}), {}},
                 {TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_INVALID_OPERATION_HANDLE), 0, {}, {}}};
    km::Client client(t);
    km::Result<km::Operation> op = client.begin(KM_PURPOSE_VERIFY, blob, begin_params);
    ASSERT_TRUE(op.ok()) << km::describe(op.status);
    EXPECT_EQ(op.value.handle, 0x1234u);
    EXPECT_EQ(op.value.out_params.serialize(), begin_out.serialize());
    ParamSet aad;
    aad.add_bytes(KM_TAG_ASSOCIATED_DATA, Bytes{'a'});
    km::Result<km::UpdateOutput> up = client.update(0x1234, input, aad);
    ASSERT_TRUE(up.ok());
    EXPECT_EQ(up.value.consumed, 60u);
    EXPECT_EQ(up.value.output, Bytes(16, 0xEE));
    km::Result<km::FinishOutput> fin = client.finish(0x1234, signature);
    ASSERT_TRUE(fin.ok()) << km::describe(fin.status);
    EXPECT_EQ(fin.value.output, (Bytes{9, 8}));
    km::Status gone = client.abort(0x1234);
    EXPECT_EQ(gone.km, KM_ERROR_INVALID_OPERATION_HANDLE);

    ASSERT_EQ(t.sent.size(), 4u);
    EXPECT_EQ(t.sent[0].cmd, KM_CMD_BEGIN);
    EXPECT_EQ(t.sent[0].types, kIo);
    EXPECT_EQ(t.sent[0].a, KM_PURPOSE_VERIFY);
    EXPECT_EQ(t.sent[0].request, cat({lv(blob), lv(begin_params.serialize())}));
    EXPECT_EQ(t.sent[1].cmd, KM_CMD_UPDATE);
    EXPECT_EQ(t.sent[1].a, 0x1234u);
    EXPECT_EQ(t.sent[1].request, cat({lv(input), lv(aad.serialize())}));
    EXPECT_EQ(t.sent[1].out_capacity, input.size() + 64) << "room for the input and some";
    EXPECT_EQ(t.sent[2].cmd, KM_CMD_FINISH);
    EXPECT_EQ(t.sent[2].a, 0x1234u);
    EXPECT_EQ(t.sent[2].request, cat({lv(signature), lv(ParamSet{}.serialize())}));
    EXPECT_EQ(t.sent[2].out_capacity, km::kFinishCapacity);
    EXPECT_EQ(t.sent[3].cmd, KM_CMD_ABORT);
    EXPECT_EQ(t.sent[3].types, kValueOnly);
    EXPECT_EQ(t.sent[3].a, 0x1234u);
}

TEST(ClientOperationWire, MalformedOperationAnswers) {
    {
        SCOPED_TRACE("begin without a handle");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, ParamSet{}.serialize(), {}}};
        km::Client client(t);
        EXPECT_EQ(client.begin(KM_PURPOSE_SIGN, Bytes{1, 2}, ParamSet{}).status.tee, TEE_ERROR_BAD_FORMAT);
        EXPECT_EQ(t.sent.size(), 1u) << "nothing to abort";
    }
    {
        SCOPED_TRACE("begin with garbled output parameters: the live operation is aborted");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 77, Bytes{2, 0, 0, 0}, {}}, {TEE_SUCCESS, 0, 0, {}, {}}};
        km::Client client(t);
        km::Result<km::Operation> r = client.begin(KM_PURPOSE_SIGN, Bytes{1, 2}, ParamSet{});
        EXPECT_EQ(r.status.tee, TEE_ERROR_BAD_FORMAT);
        EXPECT_EQ(r.value.handle, 0u);
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(t.sent[1].cmd, KM_CMD_ABORT);
        EXPECT_EQ(t.sent[1].a, 77u);
    }
    {
        SCOPED_TRACE("an update that consumed more than it was given");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 11, {}, {}}};
        km::Client client(t);
        EXPECT_EQ(client.update(5, Bytes(10, 0)).status.tee, TEE_ERROR_BAD_FORMAT);
    }
    {
        SCOPED_TRACE("finish output longer than the response");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, cat({Bytes{8, 0, 0, 0}, Bytes(4, 0)}), {}}};
        km::Client client(t);
        EXPECT_EQ(client.finish(5).status.tee, TEE_ERROR_BAD_FORMAT);
    }
    {
        SCOPED_TRACE("a refused finish keeps its error");
        Script t;
        t.answers = {{TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_VERIFICATION_FAILED), 0, {}, {}}};
        km::Client client(t);
        km::Result<km::FinishOutput> r = client.finish(5, Bytes{1});
        EXPECT_TRUE(r.status.refused());
        EXPECT_EQ(km::describe(r.status), "KM_ERROR_VERIFICATION_FAILED (-30): The signature or MAC does not verify.");
    }
}

// A source over bytes that records how much each call asked for.
struct ByteSource {
    explicit ByteSource(Bytes d = {}) : data(std::move(d)) {}
    Bytes data;
    size_t pos = 0;
    std::vector<size_t> asked;
    size_t operator()(uint8_t *buf, size_t n) {
        asked.push_back(n);
        size_t k = std::min(n, data.size() - pos);
        std::copy(data.begin() + static_cast<long>(pos), data.begin() + static_cast<long>(pos + k), buf);
        pos += k;
        return k;
    }
};

// The data of an update request: its first length-prefixed field.
Bytes update_data(const Bytes &request) {
    uint32_t n = km::get_u32(request.data());
    return Bytes(request.begin() + 4, request.begin() + 4 + n);
}

ParamSet update_params(const Bytes &request) {
    uint32_t n = km::get_u32(request.data());
    return ParamSet::parse(request.data() + 8 + n, request.size() - 8 - n).value_or(ParamSet{});
}

TEST(ClientStream, UnconsumedInputIsSentAgainWithTheNextPiece) {
    ByteSource source;
    for (uint8_t i = 0; i < 25; ++i)
        source.data.push_back(i);
    ParamSet aad;
    aad.add_bytes(KM_TAG_ASSOCIATED_DATA, Bytes{'a', 'a', 'd'});
    const Bytes signature = {0x51, 0x52};

    Script t;
    // Pieces of 10: the TA takes 7, then 10, then 4, then the last 4.
    t.answers = {{TEE_SUCCESS, 0, 7, Bytes{'x'}, {}},
                 {TEE_SUCCESS, 0, 10, {}, {}},
                 {TEE_SUCCESS, 0, 4, Bytes{'y', 'z'}, {}},
                 {TEE_SUCCESS, 0, 4, {}, {}},
                 {TEE_SUCCESS, 0, 0, cat({lv(Bytes{'!'}), lv(ParamSet{}.serialize())}), {}}};
    km::Client client(t);
    Bytes sunk;
    km::Result<km::FinishOutput> r = client.stream(
        9, std::ref(source), [&sunk](std::span<const uint8_t> d) { sunk.insert(sunk.end(), d.begin(), d.end()); }, aad,
        signature, 10);
    ASSERT_TRUE(r.ok()) << km::describe(r.status);
    EXPECT_EQ(r.value.output, Bytes{'!'});
    EXPECT_EQ(sunk, (Bytes{'x', 'y', 'z'}));

    ASSERT_EQ(t.sent.size(), 5u);
    const Bytes &in = source.data;
    auto range = [&in](size_t from, size_t to) {
        return Bytes(in.begin() + static_cast<long>(from), in.begin() + static_cast<long>(to));
    };
    EXPECT_EQ(update_data(t.sent[0].request), range(0, 10));
    EXPECT_EQ(update_data(t.sent[1].request), range(7, 17));
    EXPECT_EQ(update_data(t.sent[2].request), range(17, 25));
    EXPECT_EQ(update_data(t.sent[3].request), range(21, 25));
    EXPECT_EQ(update_params(t.sent[0].request).serialize(), aad.serialize()) << "associated data first";
    for (size_t i = 1; i < 4; ++i) {
        EXPECT_EQ(t.sent[i].cmd, KM_CMD_UPDATE);
        EXPECT_EQ(t.sent[i].a, 9u);
        EXPECT_TRUE(update_params(t.sent[i].request).params().empty()) << "and only first";
    }
    EXPECT_EQ(t.sent[4].cmd, KM_CMD_FINISH);
    EXPECT_EQ(t.sent[4].request, cat({lv(signature), lv(ParamSet{}.serialize())}));
    // Never more in memory than one piece.
    for (size_t n : source.asked)
        EXPECT_LE(n, 10u);
}

TEST(ClientStream, EveryWayOutEndsTheOperation) {
    const uint32_t refused = static_cast<uint32_t>(KM_ERROR_INVALID_ARGUMENT);
    auto no_sink = [](std::span<const uint8_t>) {};
    {
        SCOPED_TRACE("empty input, no parameters: straight to finish");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, cat({lv({}), lv(ParamSet{}.serialize())}), {}}};
        km::Client client(t);
        ByteSource empty;
        EXPECT_TRUE(client.stream(3, std::ref(empty), no_sink).ok());
        ASSERT_EQ(t.sent.size(), 1u);
        EXPECT_EQ(t.sent[0].cmd, KM_CMD_FINISH);
    }
    {
        SCOPED_TRACE("empty input with associated data: one empty update");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, {}, {}}, {TEE_SUCCESS, 0, 0, cat({lv({}), lv(ParamSet{}.serialize())}), {}}};
        km::Client client(t);
        ByteSource empty;
        ParamSet aad;
        aad.add_bytes(KM_TAG_ASSOCIATED_DATA, Bytes{1});
        EXPECT_TRUE(client.stream(3, std::ref(empty), no_sink, aad).ok());
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(update_data(t.sent[0].request), Bytes{});
    }
    {
        SCOPED_TRACE("a refused update: the TA has ended it, nothing more is sent");
        Script t;
        t.answers = {{TEE_SUCCESS, refused, 0, {}, {}}};
        km::Client client(t);
        ByteSource source(Bytes(30, 1));
        EXPECT_EQ(client.stream(3, std::ref(source), no_sink, {}, {}, 10).status.km, KM_ERROR_INVALID_ARGUMENT);
        EXPECT_EQ(t.sent.size(), 1u);
    }
    {
        SCOPED_TRACE("a TEE failure: aborted");
        Script t;
        t.answers = {{TEE_ERROR_COMMUNICATION, 0, 0, {}, {}}, {TEE_SUCCESS, 0, 0, {}, {}}};
        km::Client client(t);
        ByteSource source(Bytes(5, 1));
        EXPECT_EQ(client.stream(3, std::ref(source), no_sink).status.tee, TEE_ERROR_COMMUNICATION);
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(t.sent[1].cmd, KM_CMD_ABORT);
        EXPECT_EQ(t.sent[1].a, 3u);
    }
    {
        SCOPED_TRACE("nothing consumed of the last piece: aborted, not looped on");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 0, {}, {}}, {TEE_SUCCESS, 0, 0, {}, {}}};
        km::Client client(t);
        ByteSource source(Bytes(5, 1));
        EXPECT_EQ(client.stream(3, std::ref(source), no_sink).status.tee, TEE_ERROR_BAD_FORMAT);
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(t.sent[1].cmd, KM_CMD_ABORT);
    }
    {
        SCOPED_TRACE("the sink throws: aborted and rethrown");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 5, Bytes{1}, {}}, {TEE_SUCCESS, 0, 0, {}, {}}};
        km::Client client(t);
        ByteSource source(Bytes(5, 1));
        EXPECT_THROW(
            client.stream(3, std::ref(source), [](std::span<const uint8_t>) { throw std::runtime_error("disk full"); }),
            std::runtime_error);
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(t.sent[1].cmd, KM_CMD_ABORT);
    }
    {
        SCOPED_TRACE("a refused finish");
        Script t;
        t.answers = {{TEE_SUCCESS, 0, 5, {}, {}},
                     {TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_VERIFICATION_FAILED), 0, {}, {}}};
        km::Client client(t);
        ByteSource source(Bytes(5, 1));
        EXPECT_EQ(client.stream(3, std::ref(source), no_sink, {}, Bytes{1}).status.km, KM_ERROR_VERIFICATION_FAILED);
        EXPECT_EQ(t.sent.size(), 2u) << "finish ends it: no abort follows";
    }
}

// ---- over the embedded TEE ----

class EmbeddedKeys : public ::testing::Test {
  protected:
    void SetUp() override {
        tee_ = std::make_unique<km::EmbeddedTee>(dir_ / "state", 0);
        ASSERT_EQ(tee_->open(), TEE_SUCCESS);
        client_ = std::make_unique<km::Client>(*tee_);
    }
    static ParamSet hmac_key(uint32_t min_mac = 128) {
        ParamSet s;
        s.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
            .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
            .add(KM_TAG_MIN_MAC_LENGTH, min_mac)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
            .add_bool(KM_TAG_NO_AUTH_REQUIRED);
        return s;
    }
    // Declared first, so that the directory goes after the TEE using it.
    ScratchDir scratch_{"km-client-keys"};
    const std::filesystem::path &dir_ = scratch_.path();
    std::unique_ptr<km::EmbeddedTee> tee_;
    std::unique_ptr<km::Client> client_;
};

TEST_F(EmbeddedKeys, ImportedHmacKeyMacsAsOpenSslDoes) {
    Bytes secret(32);
    for (size_t i = 0; i < secret.size(); ++i)
        secret[i] = static_cast<uint8_t>(3 * i + 1);
    km::Result<km::ImportedKey> key = client_->import_key(hmac_key(), secret);
    ASSERT_TRUE(key.ok()) << km::describe(key.status);
    EXPECT_EQ(key.value.characteristics.find(KM_TAG_KEY_SIZE)->value, 256u);

    Bytes message(5000);
    for (size_t i = 0; i < message.size(); ++i)
        message[i] = static_cast<uint8_t>(i * 7);
    unsigned char expected[32] = {};
    unsigned int expected_len = 0;
    ASSERT_NE(HMAC(EVP_sha256(), secret.data(), static_cast<int>(secret.size()), message.data(), message.size(),
                   expected, &expected_len),
              nullptr);

    ParamSet params;
    params.add(KM_TAG_MAC_LENGTH, 256);
    km::Result<km::Operation> op = client_->begin(KM_PURPOSE_SIGN, key.value.blob, params);
    ASSERT_TRUE(op.ok()) << km::describe(op.status);
    // Three uneven pieces.
    for (auto [from, to] : {std::pair<size_t, size_t>{0, 1}, {1, 4000}, {4000, 5000}}) {
        km::Result<km::UpdateOutput> up =
            client_->update(op.value.handle, std::span<const uint8_t>(message).subspan(from, to - from));
        ASSERT_TRUE(up.ok()) << km::describe(up.status);
        EXPECT_EQ(up.value.consumed, to - from);
        EXPECT_TRUE(up.value.output.empty());
    }
    km::Result<km::FinishOutput> mac = client_->finish(op.value.handle);
    ASSERT_TRUE(mac.ok()) << km::describe(mac.status);
    EXPECT_EQ(mac.value.output, Bytes(expected, expected + expected_len));
    EXPECT_EQ(client_->abort(op.value.handle).km, KM_ERROR_INVALID_OPERATION_HANDLE) << "finish ended it";

    // Verification of the MAC, then of a changed one.
    for (bool intact : {true, false}) {
        SCOPED_TRACE(intact ? "intact" : "changed");
        Bytes signature = mac.value.output;
        if (!intact)
            signature[31] ^= 0x80;
        km::Result<km::Operation> v = client_->begin(KM_PURPOSE_VERIFY, key.value.blob, params);
        ASSERT_TRUE(v.ok());
        ASSERT_TRUE(client_->update(v.value.handle, message).ok());
        km::Result<km::FinishOutput> checked = client_->finish(v.value.handle, signature);
        if (intact) {
            EXPECT_TRUE(checked.ok()) << km::describe(checked.status);
        } else {
            EXPECT_EQ(checked.status.km, KM_ERROR_VERIFICATION_FAILED);
        }
    }
}

TEST_F(EmbeddedKeys, GeneratedKeyDescribesAndAbortEndsItsOperation) {
    ParamSet request = hmac_key();
    request.add(KM_TAG_KEY_SIZE, 256);
    ParamSet bound = request;
    bound.add_bytes(KM_TAG_APPLICATION_ID, Bytes{'a', 'p', 'p'});
    km::Result<Bytes> blob = client_->generate_key(bound);
    ASSERT_TRUE(blob.ok()) << km::describe(blob.status);
    EXPECT_LT(blob.value.size(), km::kBlobCapacity) << "trimmed";

    km::Result<ParamSet> chars = client_->characteristics({blob.value, {'a', 'p', 'p'}, {}});
    ASSERT_TRUE(chars.ok()) << km::describe(chars.status);
    ParamSet expected = request;
    expected.add(KM_TAG_ORIGIN, KM_ORIGIN_GENERATED);
    EXPECT_EQ(chars.value.serialize(), expected.serialize()) << "the request, without the application id";
    EXPECT_EQ(client_->characteristics({blob.value, {}, {}}).status.km, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_EQ(client_->export_key({blob.value, {'a', 'p', 'p'}, {}}).status.km, KM_ERROR_UNSUPPORTED_KEY_FORMAT);

    ParamSet params;
    params.add(KM_TAG_MAC_LENGTH, 128).add_bytes(KM_TAG_APPLICATION_ID, Bytes{'a', 'p', 'p'});
    km::Result<km::Operation> op = client_->begin(KM_PURPOSE_SIGN, blob.value, params);
    ASSERT_TRUE(op.ok()) << km::describe(op.status);
    EXPECT_NE(op.value.handle, 0u);
    EXPECT_TRUE(client_->abort(op.value.handle).ok());
    EXPECT_EQ(client_->update(op.value.handle, Bytes{1}).status.km, KM_ERROR_INVALID_OPERATION_HANDLE);

    EXPECT_TRUE(client_->delete_key(blob.value).ok());
    EXPECT_EQ(client_->delete_key(Bytes{1}).km, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(client_->delete_all_keys().ok());
}

} // namespace
