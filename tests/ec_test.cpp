/*
 * EC through the command interface: keys on the five NIST curves (import,
 * generation, export), ECDSA signatures checked against OpenSSL in both
 * directions, the DER codec at its edges, begin refusals, and allocation
 * failures.
 */
#include <algorithm>
#include <memory>

#include <openssl/evp.h>
#include <openssl/x509.h>

#include "ec.h"
#include "ec_der.h"
#include "key_commands.h"
#include "key_store.h"
#include "keymaster_defs.h"
#include "km/key_material.h"
#include "marshal.h"
#include "ta_entry.h"
#include "ta_heap.h"

namespace {

using km::ParamSet;
using Pkey = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;

constexpr uint32_t kSizes[] = {192, 224, 256, 384, 521};

Pkey openssl_key(uint32_t bits) {
    const std::string curve = "P-" + std::to_string(bits);
    return Pkey(EVP_PKEY_Q_keygen(nullptr, nullptr, "EC", curve.c_str()), EVP_PKEY_free);
}

Bytes pkcs8_der(EVP_PKEY *k) {
    PKCS8_PRIV_KEY_INFO *p8 = EVP_PKEY2PKCS8(k);
    unsigned char *der = nullptr;
    int n = i2d_PKCS8_PRIV_KEY_INFO(p8, &der);
    Bytes out(der, der + (n > 0 ? n : 0));
    OPENSSL_free(der);
    PKCS8_PRIV_KEY_INFO_free(p8);
    return out;
}

// ECDSA on OpenSSL over tbs as given (a digest, or unhashed input it cuts itself).
Bytes openssl_sign(EVP_PKEY *k, const Bytes &tbs) {
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_pkey(nullptr, k, nullptr);
    size_t n = 160;
    Bytes sig(n);
    bool ok = EVP_PKEY_sign_init(ctx) == 1 && EVP_PKEY_sign(ctx, sig.data(), &n, tbs.data(), tbs.size()) == 1;
    EVP_PKEY_CTX_free(ctx);
    sig.resize(ok ? n : 0);
    return sig;
}

bool openssl_verify(EVP_PKEY *k, const Bytes &tbs, const Bytes &sig) {
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_pkey(nullptr, k, nullptr);
    bool ok =
        EVP_PKEY_verify_init(ctx) == 1 && EVP_PKEY_verify(ctx, sig.data(), sig.size(), tbs.data(), tbs.size()) == 1;
    EVP_PKEY_CTX_free(ctx);
    return ok;
}

Bytes hash(uint32_t digest, const Bytes &msg) {
    Bytes h(EVP_MAX_MD_SIZE);
    unsigned int n = 0;
    EVP_Digest(msg.data(), msg.size(), h.data(), &n, md_for(digest), nullptr);
    h.resize(n);
    return h;
}

Bytes sample(size_t n, uint8_t seed) {
    Bytes b(n);
    for (size_t i = 0; i < n; ++i)
        b[i] = static_cast<uint8_t>(seed + i * 29 + 0x80);
    return b;
}

class Ec : public KeyTest {
  protected:
    static ParamSet key_params() {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_EC).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        p.add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN).add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY);
        for (uint32_t d = 0; d <= 7; ++d)
            p.add(KM_TAG_DIGEST, d);
        return p;
    }
    static ParamSet digest(uint32_t d) {
        ParamSet p;
        p.add(KM_TAG_DIGEST, d);
        return p;
    }
    static Bytes material_of(EVP_PKEY *k) {
        std::string why;
        auto m = km::ec_import_material(pkcs8_der(k), &why);
        EXPECT_TRUE(m.has_value()) << why;
        return m.value_or(Bytes{});
    }
    Bytes import_key(EVP_PKEY *k) {
        Bytes blob;
        EXPECT_TRUE(import(key_params(), material_of(k), &blob).ok()) << dump_log();
        return blob;
    }
    Bytes generate_key(uint32_t bits) {
        ParamSet p = key_params();
        p.add(KM_TAG_KEY_SIZE, bits);
        Bytes blob;
        EXPECT_TRUE(generate(p, &blob).ok()) << dump_log();
        return blob;
    }
    // The key data sealed in a blob, as a trusted client opens it.
    Bytes key_data(const Bytes &blob) {
        uint32_t trusted = open(&trusted_client_uuids[0]);
        Bytes payload;
        EXPECT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
        tee_->close_session(trusted);
        return Bytes(payload.begin() + 4, payload.begin() + 4 + km::get_u32(payload.data()));
    }
    // The exported key as OpenSSL reads the SubjectPublicKeyInfo built from it.
    Pkey exported(const Bytes &blob) {
        Bytes raw;
        EXPECT_TRUE(export_key(key_reference(blob), &raw).ok()) << dump_log();
        std::string why;
        auto der = km::public_key_der(KM_ALGORITHM_EC, raw, &why);
        EXPECT_TRUE(der.has_value()) << why;
        if (!der)
            return Pkey(nullptr, EVP_PKEY_free);
        const unsigned char *p = der->data();
        return Pkey(d2i_PUBKEY(nullptr, &p, static_cast<long>(der->size())), EVP_PKEY_free);
    }
    // begin, one update of the whole input, finish; *consumed what the update took.
    Outcome once(uint32_t purpose, const Bytes &blob, uint32_t d, const Bytes &input, const Bytes &sig, Bytes *out,
                 uint32_t *consumed = nullptr) {
        uint32_t h = 0;
        Outcome o = begin(purpose, blob, digest(d), &h);
        if (!o.ok())
            return o;
        uint32_t took = 0;
        o = update(h, input, {}, nullptr, &took);
        if (consumed)
            *consumed = took;
        if (!o.ok())
            return o;
        return finish(h, sig, {}, out);
    }
    Outcome verify(const Bytes &blob, uint32_t d, const Bytes &input, const Bytes &sig) {
        Bytes none;
        return once(KM_PURPOSE_VERIFY, blob, d, input, sig, &none);
    }
};

TEST_F(Ec, SignaturesInteroperateOnEveryCurve) {
    for (uint32_t bits : kSizes) {
        SCOPED_TRACE(bits);
        const uint32_t field = ec_field_bytes(bits);
        Pkey priv = openssl_key(bits);
        Bytes blob = import_key(priv.get());
        Pkey pub = exported(blob);
        ASSERT_TRUE(pub);
        EXPECT_EQ(EVP_PKEY_eq(pub.get(), priv.get()), 1);

        for (uint32_t d = KM_DIGEST_SHA1; d <= KM_DIGEST_SHA_2_512; ++d) {
            SCOPED_TRACE(d);
            const Bytes msg = sample(100, static_cast<uint8_t>(d));
            Bytes sig;
            ASSERT_TRUE(once(KM_PURPOSE_SIGN, blob, d, msg, {}, &sig).ok()) << dump_log();
            // OpenSSL cuts digests longer than the order itself.
            EXPECT_TRUE(openssl_verify(pub.get(), hash(d, msg), sig));
            const Bytes theirs = openssl_sign(priv.get(), hash(d, msg));
            EXPECT_TRUE(verify(blob, d, msg, theirs).ok()) << dump_log();
            EXPECT_EQ(verify(blob, d, sample(100, 0), theirs).error, KM_ERROR_VERIFICATION_FAILED);
        }

        // Unhashed: shorter than a field, exactly one (top bits set), and longer (cut to one).
        for (size_t n : {size_t{20}, size_t{field}, size_t{field + 9}}) {
            SCOPED_TRACE(n);
            const Bytes input = sample(n, 0x7F);
            Bytes sig;
            uint32_t consumed = 0;
            ASSERT_TRUE(once(KM_PURPOSE_SIGN, blob, KM_DIGEST_NONE, input, {}, &sig, &consumed).ok()) << dump_log();
            EXPECT_EQ(consumed, std::min<size_t>(n, field));
            EXPECT_TRUE(openssl_verify(pub.get(), input, sig));
            const Bytes theirs = openssl_sign(priv.get(), input);
            EXPECT_TRUE(verify(blob, KM_DIGEST_NONE, input, theirs).ok()) << dump_log();
            Bytes other = input;
            other[0] ^= 0x40;
            EXPECT_EQ(verify(blob, KM_DIGEST_NONE, other, theirs).error, KM_ERROR_VERIFICATION_FAILED);
        }
    }
}

TEST_F(Ec, GeneratedKeysOnEveryCurve) {
    int full_width = 0;
    for (uint32_t bits : kSizes) {
        SCOPED_TRACE(bits);
        const int keys = bits == 521 ? 6 : 1;
        for (int i = 0; i < keys; ++i) {
            Bytes blob = generate_key(bits);
            Bytes data = key_data(blob);
            ASSERT_GE(data.size(), 8u);
            EXPECT_EQ(km::get_u32(data.data()), bits);
            // Key size, x, y, d: the export is all of it but d and its length word.
            size_t off = 4;
            size_t before_d = 0;
            for (int v = 0; v < 3; ++v) {
                ASSERT_LE(off + 4, data.size());
                const uint32_t len = km::get_u32(data.data() + off);
                EXPECT_LE(len, ec_field_bytes(bits));
                full_width += bits == 521 && len == 66;
                before_d = off;
                off += 4 + len;
            }
            EXPECT_EQ(off, data.size());
            Bytes raw;
            ASSERT_TRUE(export_key(key_reference(blob), &raw).ok());
            EXPECT_EQ(raw, Bytes(data.begin(), data.begin() + static_cast<long>(before_d)));
            tee_host::trace::clear();
            Outcome o = export_key(key_reference(blob), &raw, before_d - 1);
            EXPECT_EQ(o, (Outcome{TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR}));
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_export_key", "Too short input")) << dump_log();

            Pkey pub = exported(blob);
            ASSERT_TRUE(pub);
            const Bytes msg = sample(64, 3);
            Bytes sig;
            ASSERT_TRUE(once(KM_PURPOSE_SIGN, blob, KM_DIGEST_SHA_2_256, msg, {}, &sig).ok()) << dump_log();
            EXPECT_TRUE(openssl_verify(pub.get(), hash(KM_DIGEST_SHA_2_256, msg), sig));
        }
    }
    EXPECT_GT(full_width, 0) << "no P-521 value needed all 66 bytes";
}

TEST_F(Ec, GenerationRefusals) {
    Bytes blob;
    for (uint32_t bits : {255u, 512u, 0u}) {
        ParamSet p = key_params();
        p.add(KM_TAG_KEY_SIZE, bits);
        tee_host::trace::clear();
        EXPECT_EQ(generate(p, &blob).error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_generate_key", "Invalid EC key size " + std::to_string(bits)));
    }
    ParamSet twice = key_params();
    twice.add(KM_TAG_KEY_SIZE, 256).add(KM_TAG_KEY_SIZE, 256);
    for (const ParamSet &p : {key_params(), twice}) {
        tee_host::trace::clear();
        EXPECT_EQ(generate(p, &blob).error, KM_ERROR_INVALID_ARGUMENT);
        EXPECT_TRUE(logged_message("No or too many KM_TAG_KEY_SIZE or specified"));
    }
    ParamSet origin = key_params();
    origin.add(KM_TAG_KEY_SIZE, 256).add(KM_TAG_ORIGIN, KM_ORIGIN_GENERATED);
    tee_host::trace::clear();
    EXPECT_EQ(generate(origin, &blob).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_generate_key", "Shouldn't specify KM_TAG_ORIGIN"));
}

TEST_F(Ec, ImportKeepsTheMaterialAndChecksItsSize) {
    Pkey priv = openssl_key(256);
    const Bytes material = material_of(priv.get());
    Bytes blob, chars;
    ASSERT_TRUE(import(key_params(), concat({material, {1, 2, 3}}), &blob, &chars).ok()) << dump_log();
    EXPECT_EQ(key_data(blob), material) << "the trailing bytes are dropped";
    auto set = ParamSet::parse(chars.data(), chars.size());
    ASSERT_TRUE(set);
    EXPECT_EQ(set->find(KM_TAG_KEY_SIZE)->value, 256u);
    EXPECT_EQ(set->find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);

    ParamSet p384 = key_params();
    p384.add(KM_TAG_KEY_SIZE, 384);
    tee_host::trace::clear();
    EXPECT_EQ(import(p384, material, &blob).error, KM_ERROR_IMPORT_PARAMETER_MISMATCH);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_import_key", "Key size mismatch (given 384, guessed 256)"));
    ParamSet p256 = key_params();
    p256.add(KM_TAG_KEY_SIZE, 256);
    EXPECT_TRUE(import(p256, material, &blob).ok());
    ParamSet origin = key_params();
    origin.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    EXPECT_EQ(import(origin, material, &blob).error, KM_ERROR_INVALID_ARGUMENT);

    Bytes odd_size = material;
    odd_size[0] = 200;
    odd_size[1] = 0;
    tee_host::trace::clear();
    EXPECT_EQ(import(key_params(), odd_size, &blob).error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_import_key", "Invalid EC key size 200"));

    // Cut in the key size, in a length word, inside x and inside d.
    for (size_t cut : {size_t{0}, size_t{3}, size_t{6}, size_t{20}, material.size() - 1}) {
        tee_host::trace::clear();
        EXPECT_EQ(import(key_params(), Bytes(material.begin(), material.begin() + static_cast<long>(cut)), &blob).res,
                  TEE_ERROR_GENERIC)
            << cut;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_import_key", "Too short input")) << cut;
    }

    // The values are not examined at import; a point off the curve fails when the key is loaded.
    Bytes off_curve = material;
    off_curve[8 + 31] ^= 1; // last byte of x
    ASSERT_TRUE(import(key_params(), off_curve, &blob).ok());
    uint32_t h = 0;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_VERIFY, blob, digest(KM_DIGEST_SHA_2_256), &h).error, KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_resolve_key_data", "PopulateTransientObject failed with 0xffff0006"))
        << dump_log();
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "create_ec_verify", "Resolve key data failed"));
}

TEST_F(Ec, BeginRefusals) {
    Pkey priv = openssl_key(256);
    Bytes blob = import_key(priv.get());
    ParamSet twice = digest(KM_DIGEST_SHA1);
    twice.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256);
    struct Case {
        uint32_t purpose;
        ParamSet params;
        int32_t error;
        const char *log;
    };
    const Case cases[] = {
        {KM_PURPOSE_SIGN, digest(KM_DIGEST_MD5), KM_ERROR_INCOMPATIBLE_DIGEST, nullptr},
        {KM_PURPOSE_VERIFY, digest(KM_DIGEST_MD5), KM_ERROR_INCOMPATIBLE_DIGEST, nullptr},
        {KM_PURPOSE_SIGN, digest(7), KM_ERROR_UNSUPPORTED_DIGEST, nullptr},
        {KM_PURPOSE_SIGN, {}, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_DIGEST"},
        {KM_PURPOSE_VERIFY, twice, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_DIGEST"},
        {KM_PURPOSE_ENCRYPT, digest(KM_DIGEST_SHA1), KM_ERROR_UNSUPPORTED_PURPOSE,
         "Algorithm EC purpose 0 not implemented"},
    };
    for (const Case &c : cases) {
        uint32_t h = 0;
        tee_host::trace::clear();
        EXPECT_EQ(begin(c.purpose, blob, c.params, &h).error, c.error) << c.purpose << "\n" << dump_log();
        if (c.log) {
            EXPECT_TRUE(logged_message(c.log)) << dump_log();
        }
        EXPECT_EQ(logged_count("Try to free", true), 0) << dump_log();
    }
    // KM_DIGEST_NONE is taken although the digest list leaves it out.
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, digest(KM_DIGEST_NONE), &h).ok());
    // Unhashed input beyond one field is left unconsumed, without an error.
    uint32_t consumed = 0;
    ASSERT_TRUE(update(h, sample(40, 1), {}, nullptr, &consumed).ok());
    EXPECT_EQ(consumed, 32u);
    ASSERT_TRUE(update(h, sample(5, 1), {}, nullptr, &consumed).ok());
    EXPECT_EQ(consumed, 0u);
    EXPECT_TRUE(abort(h).ok());
}

// Key data that names no curve fails in resolving it, before create's own size check.
TEST_F(Ec, KeyDataOfAnUnknownSizeMakesNoObject) {
    Pkey priv = openssl_key(256);
    Bytes data = material_of(priv.get());
    data[0] = 200;
    data[1] = 0;
    keymaster_key_param_set_t key_params{};
    keymaster_key_param_set_t in_params{};
    keymaster_key_param_set_t out_params{};
    Bytes ser = digest(KM_DIGEST_SHA_2_256).serialize();
    ASSERT_EQ(unmarshal(ser.data(), static_cast<uint32_t>(ser.size()), &in_params), TEE_SUCCESS);
    tee_host::trace::clear();
    const size_t objects_before = tee_host::handles::live_objects();
    int32_t error = 0;
    const purpose_ops_t *ops = find_purpose_ops(KM_ALGORITHM_EC, KM_PURPOSE_SIGN);
    ASSERT_NE(ops, nullptr);
    EXPECT_EQ(ops->create_operation(data.data(), static_cast<uint32_t>(data.size()), &key_params, &in_params,
                                    &out_params, &error),
              nullptr);
    EXPECT_EQ(error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "create_ec_sign", "Resolve key data failed"));
    EXPECT_FALSE(logged_message("Unsupported key size 200"));
    EXPECT_EQ(tee_host::handles::live_objects(), objects_before);
    key_param_set_release(&in_params);
}

// The encoder's output byte for byte, and the decoder giving it back.
TEST_F(Ec, DerEncodingsAtTheirEdges) {
    auto encode = [](const Bytes &r, const Bytes &s) {
        uint32_t n = 0;
        uint8_t *p = der_encode_ec_signature(r.data(), static_cast<uint32_t>(r.size()), s.data(),
                                             static_cast<uint32_t>(s.size()), &n);
        Bytes out(p, p + (p ? n : 0));
        ta_free(p);
        return out;
    };
    Bytes low_r = sample(32, 0x11), low_s = sample(32, 0x22);
    low_r[0] = 0x11; // first bytes below 0x80: no sign byte
    low_s[0] = 0x22;
    Bytes high_r = low_r, high_s = low_s;
    high_r[0] |= 0x80;
    high_s[0] |= 0x80;
    EXPECT_EQ(encode(low_r, low_s), concat({hex("3044"), hex("0220"), low_r, hex("0220"), low_s}));
    EXPECT_EQ(encode(high_r, high_s), concat({hex("3046"), hex("022100"), high_r, hex("022100"), high_s}));
    Bytes r7f(32, 0x33);
    r7f[0] = 0x00;
    r7f[1] = 0x7F;
    EXPECT_EQ(encode(r7f, low_s),
              concat({hex("3043"), hex("021F"), Bytes(r7f.begin() + 1, r7f.end()), hex("0220"), low_s}));
    Bytes r521(66, 0x44), s521(66, 0x55);
    r521[0] = s521[0] = 0x01;
    EXPECT_EQ(encode(r521, s521), concat({hex("308188"), hex("0242"), r521, hex("0242"), s521}));
    // Content of 127 bytes keeps the short form; 128 takes the long one.
    const Bytes c127 = encode(Bytes(61, 0x01), Bytes(62, 0x01));
    EXPECT_EQ(c127.size(), 2u + 127u);
    EXPECT_EQ(to_hex(c127.data(), 2), "307f");
    const Bytes c128 = encode(Bytes(61, 0x01), Bytes(63, 0x01));
    EXPECT_EQ(c128.size(), 3u + 128u);
    EXPECT_EQ(to_hex(c128.data(), 3), "308180");

    uint8_t field[8] = {};
    for (auto [len, want] :
         {std::pair{0u, "00"}, std::pair{127u, "7f"}, std::pair{128u, "8180"}, std::pair{255u, "81ff"},
          std::pair{256u, "820100"}, std::pair{0x10000u, "83010000"}, std::pair{0x1000000u, "8401000000"}}) {
        byte_writer w(field, sizeof field);
        ASSERT_TRUE(encode_length(&w, len));
        EXPECT_EQ(to_hex(field, w.written()), want) << len;
        EXPECT_EQ(der_length_size(len), w.written());
    }

    // Decoding gives the halves back right-aligned to the field width.
    const Bytes der = encode(r7f, low_s);
    uint8_t r[32], s[32];
    ASSERT_EQ(der_decode_ec_signature(der.data(), static_cast<uint32_t>(der.size()), r, 32, s, 32), TEE_SUCCESS);
    EXPECT_EQ(Bytes(r, r + 32), r7f);
    EXPECT_EQ(Bytes(s, s + 32), low_s);
}

// Digests are cut to the key's leftmost bits: whole bytes, then P-521's 7-bit shift.
TEST_F(Ec, DigestTruncationKeepsTheLeftmostBits) {
    Bytes d = sample(64, 9);
    EXPECT_EQ(ec_truncate_digest(d.data(), 64, 256), 32u);
    EXPECT_EQ(d, sample(64, 9)) << "whole bytes are cut by the length alone";
    Bytes full(66, 0xFF);
    EXPECT_EQ(ec_truncate_digest(full.data(), 66, 521), 66u);
    EXPECT_EQ(to_hex(full.data(), 2), "01ff");
    EXPECT_EQ(full[65], 0xFF);
    Bytes pattern(66, 0x00);
    pattern[0] = 0x80;
    pattern[65] = 0x80;
    ec_truncate_digest(pattern.data(), 66, 521);
    EXPECT_EQ(pattern[0], 0x01);
    EXPECT_EQ(pattern[1], 0x00);
    EXPECT_EQ(pattern[65], 0x01);
    Bytes sha256(32, 0xAB);
    EXPECT_EQ(ec_truncate_digest(sha256.data(), 32, 521), 32u);
    EXPECT_EQ(sha256, Bytes(32, 0xAB));
}

// Every refused signature reaches the caller as a failed verification, with
// the decoder's own reason logged; none reads past the input.
TEST_F(Ec, VerificationRefusesAnythingButCanonicalDer) {
    Pkey priv = openssl_key(256);
    Bytes blob = import_key(priv.get());
    const Bytes msg = sample(50, 1);
    // A valid signature whose r and s both need a sign byte, so that edits have something to remove.
    Bytes good;
    do
        good = openssl_sign(priv.get(), hash(KM_DIGEST_SHA_2_256, msg));
    while (good.size() != 72);
    ASSERT_TRUE(verify(blob, KM_DIGEST_SHA_2_256, msg, good).ok()) << dump_log();
    const Bytes r(good.begin() + 5, good.begin() + 37), s(good.begin() + 40, good.end());
    Bytes low_r = r;
    low_r[0] = 0x12; // same length, no sign byte needed
    Bytes short_r(r.begin() + 1, r.end());
    short_r[0] = 0x12; // 31 significant bytes

    struct Case {
        const char *name;
        Bytes der;
        const char *log;
    };
    const Case cases[] = {
        {"empty", {}, "Wrong der length"},
        {"one byte", hex("30"), "Wrong der length"},
        {"wrong tag", concat({hex("31"), Bytes(good.begin() + 1, good.end())}), "Wrong tag, expect 0x30, got 0x31"},
        {"trailing byte", concat({good, hex("00")}), "Wrong length of sequence, expect 71B, got 70B"},
        {"BER long-form sequence length", concat({hex("308146"), Bytes(good.begin() + 2, good.end())}),
         "Encoding size mismatch"},
        {"BER long-form integer length", concat({hex("3047028121"), Bytes(good.begin() + 4, good.end())}),
         "Encoding size mismatch"},
        {"five length bytes", concat({hex("30850000000046"), Bytes(good.begin() + 2, good.end())}),
         "Decode length failed"},
        {"length bytes missing", hex("308200"), "Decode length failed"},
        {"zero before a low byte", concat({hex("3046022100"), low_r, hex("022100"), s}), "Encoding size mismatch"},
        {"two leading zeros", concat({hex("30460221"), hex("0000"), short_r, hex("022100"), s}),
         "Encoding size mismatch"},
        {"missing sign byte", concat({hex("30450220"), r, hex("022100"), s}), "Encoding size mismatch"},
        {"negative integer", concat({hex("3026"), hex("0201FF"), hex("022100"), s}), "Encoding size mismatch"},
        {"sign byte moved from s to r", concat({hex("3045022100"), low_r, hex("0220"), s}), "Encoding mismatch"},
        {"wrong integer tag", concat({hex("3046032100"), r, hex("022100"), s}), "Wrong tag, expect 0x02, got 0x03"},
        {"r longer than the field", concat({hex("3046022101"), r, hex("022100"), s}),
         "Wrong length of R, expect max 32B, got 33B"},
        {"s longer than the field", concat({hex("3046022100"), r, hex("022101"), s}),
         "Wrong length of S, expect max 32B, got 33B"},
        {"integer past the end", concat({hex("3046022100"), r, hex("022200"), s}),
         "Wrong length of integer, 33B available, got 34B"},
        {"zero r with a zero byte", concat({hex("3026"), hex("020100"), hex("022100"), s}), "Encoding size mismatch"},
        {"s missing", concat({hex("3023022100"), r}), "Too short input"},
    };
    for (const Case &c : cases) {
        tee_host::trace::clear();
        EXPECT_EQ(verify(blob, KM_DIGEST_SHA_2_256, msg, c.der), (Outcome{TEE_SUCCESS, KM_ERROR_VERIFICATION_FAILED}))
            << c.name;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "der_decode_ec_signature", c.log)) << c.name << "\n" << dump_log();
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "ec_verify_finish", "Decode signature failed, 0xffff0000")) << c.name;
    }
    // A zero r in its one canonical spelling decodes, and the TEE refuses it.
    tee_host::trace::clear();
    EXPECT_EQ(verify(blob, KM_DIGEST_SHA_2_256, msg, concat({hex("3025"), hex("0200"), hex("022100"), s})).error,
              KM_ERROR_VERIFICATION_FAILED);
    EXPECT_FALSE(logged_message("Decode signature failed, 0xffff0000"));
}

TEST_F(Ec, DestroyNamesEachMissingMember) {
    Bytes blob = generate_key(256);
    for (int missing = 1; missing <= 3; ++missing) {
        operation_t *op = create_record(blob, KM_ALGORITHM_EC, KM_PURPOSE_VERIFY, digest(KM_DIGEST_SHA_2_256));
        ASSERT_NE(op, nullptr);
        auto *rec = operation_record<ec_verify_operation_t>(op);
        TEE_FreeTransientObject(rec->key);
        rec->key = nullptr;
        if (missing >= 2) {
            TEE_FreeOperation(rec->operation);
            rec->operation = nullptr;
        }
        if (missing >= 3) {
            ta_free(rec->message);
            rec->message = nullptr;
        }
        tee_host::trace::clear();
        operation_destroy(op);
        EXPECT_EQ(logged_count("Try to free invalid ec_verify_operation_t"), missing) << dump_log();
    }
}

// Each allocation of each command fails in turn: the command reports the
// shortage and leaves nothing allocated; an operation it ends is gone.
TEST_F(Ec, AllocationFailuresLeaveNothingBehind) {
    Pkey priv = openssl_key(384);
    const Bytes material = material_of(priv.get());
    Bytes blob = import_key(priv.get());
    const Bytes msg = sample(64, 2);
    const Bytes sig = openssl_sign(priv.get(), hash(KM_DIGEST_SHA_2_384, msg));
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    const Outcome provider_oom{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED};
    const Outcome unparsed{TEE_ERROR_BAD_PARAMETERS, 0};
    const Outcome bad_params{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT};
    const Outcome no_object{TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR};
    ParamSet gen = key_params();
    gen.add(KM_TAG_KEY_SIZE, 521);
    {
        Bytes b;
        EXPECT_GT(
            sweep_allocations("generate", nullptr, [&] { return generate(gen, &b); }, {oom, unparsed, provider_oom}),
            0);
        EXPECT_GT(sweep_allocations("import", nullptr, [&] { return import(key_params(), material, &b); },
                                    {oom, unparsed, provider_oom}),
                  0);
    }
    for (uint32_t purpose : {KM_PURPOSE_SIGN, KM_PURPOSE_VERIFY}) {
        const char *names[] = {"begin", "update", "finish"};
        for (uint32_t step = 0; step < 3; ++step) {
            uint32_t h = 0;
            std::vector<Outcome> allowed = {oom, provider_oom, bad_params};
            if (step == 0)
                allowed.insert(allowed.end(), {unparsed, no_object});
            if (step == 2 && purpose == KM_PURPOSE_VERIFY) // the decoder's re-encoding not made: refused
                allowed.push_back({TEE_SUCCESS, KM_ERROR_VERIFICATION_FAILED});
            const std::string what = std::string(names[step]) + (purpose == KM_PURPOSE_SIGN ? " sign" : " verify");
            int n = sweep_allocations(
                what,
                [&] {
                    if (step > 0) {
                        ASSERT_TRUE(begin(purpose, blob, digest(KM_DIGEST_SHA_2_384), &h).ok());
                    }
                },
                [&] {
                    Outcome o{};
                    if (step == 0)
                        o = begin(purpose, blob, digest(KM_DIGEST_SHA_2_384), &h);
                    else if (step == 1)
                        o = update(h, msg);
                    else
                        o = finish(h, purpose == KM_PURPOSE_VERIFY ? sig : Bytes{});
                    Outcome after = abort(h);
                    if (tee_host::heap::injected_failure_fired()) {
                        EXPECT_EQ(after.error, KM_ERROR_INVALID_OPERATION_HANDLE) << what;
                    }
                    return o;
                },
                allowed);
            EXPECT_GT(n, 0) << what;
        }
    }
}

} // namespace
