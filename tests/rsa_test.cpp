/*
 * RSA through the command interface: keys (import, generation, export),
 * signatures and ciphertexts checked against OpenSSL in both directions,
 * the padding limits, begin refusals, and memory for large keys.
 */
#include <cstring>
#include <memory>

#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509.h>

#include "key_commands.h"
#include "key_store.h"
#include "marshal.h"
#include "rsa.h"
#include "km/key_material.h"
#include "keymaster_defs.h"
#include "rsa_keys.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;
using Pkey = std::unique_ptr<EVP_PKEY, decltype(&EVP_PKEY_free)>;

Pkey load_pem(const char *pem) {
    BIO *bio = BIO_new_mem_buf(pem, -1);
    EVP_PKEY *k = PEM_read_bio_PrivateKey(bio, nullptr, nullptr, nullptr);
    BIO_free(bio);
    return Pkey(k, EVP_PKEY_free);
}

// One OpenSSL public- or private-key operation with the given padding settings.
enum class Op { Sign, Verify, Encrypt, Decrypt, VerifyRecover };
struct Pad {
    int padding;
    const EVP_MD *md = nullptr;
    int salt = RSA_PSS_SALTLEN_AUTO;
};

bool openssl(Op op, EVP_PKEY *k, const Pad &pad, const Bytes &in, Bytes *out, const Bytes &sig = {}) {
    EVP_PKEY_CTX *ctx = EVP_PKEY_CTX_new_from_pkey(nullptr, k, nullptr);
    int ok = 0;
    switch (op) {
    case Op::Sign:
        ok = EVP_PKEY_sign_init(ctx);
        break;
    case Op::Verify:
        ok = EVP_PKEY_verify_init(ctx);
        break;
    case Op::Encrypt:
        ok = EVP_PKEY_encrypt_init(ctx);
        break;
    case Op::Decrypt:
        ok = EVP_PKEY_decrypt_init(ctx);
        break;
    case Op::VerifyRecover:
        ok = EVP_PKEY_verify_recover_init(ctx);
        break;
    }
    ok = ok == 1 && EVP_PKEY_CTX_set_rsa_padding(ctx, pad.padding) == 1;
    if (ok && pad.md && pad.padding == RSA_PKCS1_OAEP_PADDING)
        ok = EVP_PKEY_CTX_set_rsa_oaep_md(ctx, pad.md) == 1 && EVP_PKEY_CTX_set_rsa_mgf1_md(ctx, pad.md) == 1;
    else if (ok && pad.md)
        ok = EVP_PKEY_CTX_set_signature_md(ctx, pad.md) == 1;
    if (ok && pad.padding == RSA_PKCS1_PSS_PADDING)
        ok = EVP_PKEY_CTX_set_rsa_pss_saltlen(ctx, pad.salt) == 1;
    size_t n = 1024;
    if (out)
        out->assign(n, 0);
    if (ok) {
        switch (op) {
        case Op::Sign:
            ok = EVP_PKEY_sign(ctx, out->data(), &n, in.data(), in.size()) == 1;
            break;
        case Op::Verify:
            ok = EVP_PKEY_verify(ctx, sig.data(), sig.size(), in.data(), in.size()) == 1;
            break;
        case Op::Encrypt:
            ok = EVP_PKEY_encrypt(ctx, out->data(), &n, in.data(), in.size()) == 1;
            break;
        case Op::Decrypt:
            ok = EVP_PKEY_decrypt(ctx, out->data(), &n, in.data(), in.size()) == 1;
            break;
        case Op::VerifyRecover:
            ok = EVP_PKEY_verify_recover(ctx, out->data(), &n, sig.data(), sig.size()) == 1;
            break;
        }
    }
    if (out)
        out->resize(ok ? n : 0);
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
        b[i] = static_cast<uint8_t>(seed + i * 13);
    return b;
}

class Rsa : public KeyTest {
  protected:
    ParamSet key_params() {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA).add_bool(KM_TAG_NO_AUTH_REQUIRED);
        for (uint32_t purpose : {0u, 1u, 2u, 3u})
            p.add(KM_TAG_PURPOSE, purpose);
        for (uint32_t pad : {1u, 2u, 3u, 4u, 5u})
            p.add(KM_TAG_PADDING, pad);
        for (uint32_t d = 0; d <= 6; ++d)
            p.add(KM_TAG_DIGEST, d);
        return p;
    }
    Bytes import_pem(const char *pem, ParamSet extra = {}) {
        ParamSet p = key_params();
        for (const auto &x : extra.params())
            p.add(x.tag, x.value);
        Bytes blob;
        EXPECT_TRUE(import(p, rsa_material(pem), &blob).ok()) << dump_log();
        return blob;
    }
    Pkey exported(const Bytes &blob) {
        Bytes der;
        EXPECT_TRUE(export_key(key_reference(blob), &der).ok()) << dump_log();
        const unsigned char *p = der.data();
        return Pkey(d2i_PUBKEY(nullptr, &p, static_cast<long>(der.size())), EVP_PKEY_free);
    }
    ParamSet op_params(uint32_t padding, int digest = -1) {
        ParamSet p;
        p.add(KM_TAG_PADDING, padding);
        if (digest >= 0)
            p.add(KM_TAG_DIGEST, static_cast<uint32_t>(digest));
        return p;
    }
    Outcome ta(uint32_t purpose, const Bytes &blob, const ParamSet &params, const Bytes &in, Bytes *out,
               const Bytes &sig = {}) {
        return run(purpose, blob, params, in, in.size() ? in.size() : 1, sig, out);
    }
};

TEST_F(Rsa, ImportCompletesTheParametersAndKeepsTheMaterial) {
    Bytes material = rsa_material(kRsa2048Pem);
    ParamSet p = key_params();
    Bytes blob, chars;
    Bytes with_tail = material;
    with_tail.insert(with_tail.end(), {9, 9, 9});
    ASSERT_TRUE(import(p, with_tail, &blob, &chars).ok()) << dump_log();
    auto set = ParamSet::parse(chars.data(), chars.size());
    ASSERT_TRUE(set);
    EXPECT_EQ(set->find(KM_TAG_KEY_SIZE)->value, 2048u);
    EXPECT_EQ(set->find(KM_TAG_RSA_PUBLIC_EXPONENT)->value, 65537u);
    EXPECT_EQ(set->find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);

    // The key data is the material behind the key size; the tail is dropped.
    uint32_t trusted = open(&trusted_client_uuids[0]);
    Bytes payload;
    ASSERT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
    tee_->close_session(trusted);
    ASSERT_EQ(km::get_u32(payload.data()), material.size() + 4);
    EXPECT_EQ(to_hex(Bytes(payload.begin() + 4, payload.begin() + 8)), "00080000");
    EXPECT_EQ(Bytes(payload.begin() + 8, payload.begin() + 8 + material.size()), material);

    ParamSet wrong_size = key_params();
    wrong_size.add(KM_TAG_KEY_SIZE, 2047);
    tee_host::trace::clear();
    EXPECT_EQ(import(wrong_size, material, &blob).error, KM_ERROR_IMPORT_PARAMETER_MISMATCH);
    EXPECT_TRUE(logged_message("Key size mismatch (given 2047, guessed 2048)"));
    ParamSet wrong_e = key_params();
    wrong_e.add(KM_TAG_RSA_PUBLIC_EXPONENT, 3);
    tee_host::trace::clear();
    EXPECT_EQ(import(wrong_e, material, &blob).error, KM_ERROR_IMPORT_PARAMETER_MISMATCH);
    EXPECT_TRUE(logged_message("Public exponent mismatch"));
    ParamSet right_e = key_params();
    right_e.add(KM_TAG_RSA_PUBLIC_EXPONENT, 65537).add(KM_TAG_KEY_SIZE, 2048);
    EXPECT_TRUE(import(right_e, material, &blob).ok());
    ParamSet origin = key_params();
    origin.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    EXPECT_EQ(import(origin, material, &blob).error, KM_ERROR_INVALID_ARGUMENT);

    // Cut inside a length word and inside components.
    for (size_t cut : {size_t{2}, size_t{4}, size_t{100}, size_t{260}, material.size() - 1}) {
        tee_host::trace::clear();
        EXPECT_EQ(import(p, Bytes(material.begin(), material.begin() + static_cast<long>(cut)), &blob).res,
                  TEE_ERROR_GENERIC)
            << cut;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "rsa_import_key", "Too short input"));
    }
}

TEST_F(Rsa, GenerationRules) {
    ParamSet p = key_params();
    p.add(KM_TAG_KEY_SIZE, 1024).add(KM_TAG_RSA_PUBLIC_EXPONENT, 65537);
    Bytes blob, chars;
    ASSERT_TRUE(generate(p, &blob).ok()) << dump_log();
    ASSERT_TRUE(characteristics(key_reference(blob), &chars).ok());
    auto set = ParamSet::parse(chars.data(), chars.size());
    EXPECT_EQ(set->count(KM_TAG_ORIGIN), 1u);
    EXPECT_EQ(set->find(KM_TAG_ORIGIN)->value, KM_ORIGIN_GENERATED);
    Pkey pub = exported(blob);
    ASSERT_TRUE(pub);
    EXPECT_EQ(EVP_PKEY_get_bits(pub.get()), 1024);

    for (uint32_t bits : {1025u, 8200u}) {
        ParamSet bad = key_params();
        bad.add(KM_TAG_KEY_SIZE, bits).add(KM_TAG_RSA_PUBLIC_EXPONENT, 65537);
        tee_host::trace::clear();
        EXPECT_EQ(generate(bad, &blob).error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
        EXPECT_TRUE(logged_message("Invalid RSA key size " + std::to_string(bits)));
    }
    // 0 bits passes the size rule (whole bytes, not above the maximum); the
    // TEE refuses it, and its answer comes back, not an unknown error.
    ParamSet zero = key_params();
    zero.add(KM_TAG_KEY_SIZE, 0).add(KM_TAG_RSA_PUBLIC_EXPONENT, 65537);
    const Outcome refused = generate(zero, &blob);
    EXPECT_EQ(refused.res, TEE_ERROR_NOT_SUPPORTED) << dump_log();
    EXPECT_EQ(refused.error, KM_ERROR_OK);
    EXPECT_TRUE(blob.empty());
    ParamSet no_e = key_params();
    no_e.add(KM_TAG_KEY_SIZE, 1024);
    tee_host::trace::clear();
    EXPECT_EQ(generate(no_e, &blob).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged_message("No or too many KM_TAG_RSA_PUBLIC_EXPONENT specified"));
}

TEST_F(Rsa, Generates2048BitKeysWithTheirKeyData) {
    ParamSet p = key_params();
    p.add(KM_TAG_KEY_SIZE, 2048).add(KM_TAG_RSA_PUBLIC_EXPONENT, 3);
    Bytes blob;
    ASSERT_TRUE(generate(p, &blob).ok()) << dump_log();
    uint32_t trusted = open(&trusted_client_uuids[0]);
    Bytes payload;
    ASSERT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
    tee_->close_session(trusted);
    EXPECT_EQ(to_hex(Bytes(payload.begin() + 4, payload.begin() + 12)), "0008000000010000");
    // It signs, and OpenSSL verifies under the exported key.
    Bytes msg = sample(100, 1), sig;
    ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 4), msg, &sig).ok());
    Pkey pub = exported(blob);
    EXPECT_TRUE(openssl(Op::Verify, pub.get(), {RSA_PKCS1_PADDING, EVP_sha256()}, hash(4, msg), nullptr, sig));
}

TEST_F(Rsa, ExportedKeyMatchesAndShortBuffersFail) {
    Bytes blob = import_pem(kRsa1024Pem);
    Pkey priv = load_pem(kRsa1024Pem);
    Pkey pub = exported(blob);
    ASSERT_TRUE(pub);
    EXPECT_EQ(EVP_PKEY_eq(pub.get(), priv.get()), 1);
    Bytes der;
    ASSERT_TRUE(export_key(key_reference(blob), &der).ok());
    Bytes small;
    tee_host::trace::clear();
    Outcome o = export_key(key_reference(blob), &small, der.size() - 1);
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "export_key", "Export key failed"));
}

TEST_F(Rsa, SignaturesInteroperateBothWays) {
    struct KeyCase {
        const char *pem;
        bool all_digests;
    };
    const KeyCase keys[] = {{kRsa1024Pem, true}, {kRsa2048Pem, true}, {kRsa3072Pem, false}, {kRsa4096Pem, false}};
    const Bytes msg = sample(333, 5);
    for (const KeyCase &kc : keys) {
        Bytes blob = import_pem(kc.pem);
        Pkey priv = load_pem(kc.pem);
        Pkey pub = exported(blob);
        const int bits = EVP_PKEY_get_bits(priv.get());
        SCOPED_TRACE(bits);
        for (uint32_t d = 1; d <= 6; ++d) {
            if (!kc.all_digests && d != KM_DIGEST_SHA_2_256)
                continue;
            Bytes sig;
            ASSERT_TRUE(
                ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, static_cast<int>(d)), msg, &sig).ok())
                << dump_log();
            EXPECT_EQ(sig.size(), static_cast<size_t>(bits / 8));
            EXPECT_TRUE(openssl(Op::Verify, pub.get(), {RSA_PKCS1_PADDING, md_for(d)}, hash(d, msg), nullptr, sig))
                << d;
            Bytes theirs;
            ASSERT_TRUE(openssl(Op::Sign, priv.get(), {RSA_PKCS1_PADDING, md_for(d)}, hash(d, msg), &theirs));
            Bytes none;
            EXPECT_TRUE(ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, static_cast<int>(d)), msg,
                           &none, theirs)
                            .ok())
                << d;
            if (d == KM_DIGEST_MD5)
                continue;
            ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PSS, static_cast<int>(d)), msg, &sig).ok()) << d;
            EXPECT_TRUE(openssl(Op::Verify, pub.get(), {RSA_PKCS1_PSS_PADDING, md_for(d), RSA_PSS_SALTLEN_AUTO},
                                hash(d, msg), nullptr, sig))
                << "PSS " << d;
            for (int salt : {RSA_PSS_SALTLEN_DIGEST, RSA_PSS_SALTLEN_MAX}) {
                // A digest-length salt does not always fit (SHA-512 on 1024 bits).
                if (salt == RSA_PSS_SALTLEN_DIGEST && 2 * hash(d, msg).size() + 2 > static_cast<size_t>(bits / 8))
                    continue;
                ASSERT_TRUE(
                    openssl(Op::Sign, priv.get(), {RSA_PKCS1_PSS_PADDING, md_for(d), salt}, hash(d, msg), &theirs));
                EXPECT_TRUE(
                    ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PSS, static_cast<int>(d)), msg, &none, theirs)
                        .ok())
                    << "PSS " << d << " salt " << salt;
                theirs[10] ^= 1;
                EXPECT_EQ(
                    ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PSS, static_cast<int>(d)), msg, &none, theirs)
                        .error,
                    KM_ERROR_VERIFICATION_FAILED);
            }
        }
    }
}

TEST_F(Rsa, PssSaltFollowsTheKeySize) {
    // 1024-bit key: SHA-512 leaves no room for a digest-length salt, SHA-256 does.
    Bytes blob = import_pem(kRsa1024Pem);
    Pkey pub = exported(blob);
    const Bytes msg = sample(40, 9);
    for (auto [d, salt] : {std::pair{KM_DIGEST_SHA_2_512, 128 - 64 - 2}, std::pair{KM_DIGEST_SHA_2_256, 32}}) {
        Bytes sig, digits;
        ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PSS, static_cast<int>(d)), msg, &sig).ok());
        EXPECT_TRUE(
            openssl(Op::Verify, pub.get(), {RSA_PKCS1_PSS_PADDING, md_for(d), salt}, hash(d, msg), nullptr, sig))
            << "digest " << d << " salt " << salt;
    }
    Bytes small = import_pem(kRsa512Pem);
    uint32_t h = 0;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, small, op_params(KM_PAD_RSA_PSS, KM_DIGEST_SHA_2_512), &h).error,
              KM_ERROR_INCOMPATIBLE_DIGEST);
    EXPECT_TRUE(logged_message("Too short key to fit digest, flag and salt, key_size 512, need 688"));
    EXPECT_TRUE(begin(KM_PURPOSE_SIGN, small, op_params(KM_PAD_RSA_PSS, KM_DIGEST_SHA1), &h).ok());
    EXPECT_TRUE(abort(h).ok());
}

TEST_F(Rsa, UnhashedSignaturesAndTheirLimits) {
    Bytes blob = import_pem(kRsa2048Pem);
    Pkey priv = load_pem(kRsa2048Pem);
    Pkey pub = exported(blob);
    Bytes sig, recovered, none;
    // PKCS#1 without a digest: the message itself in a type-1 block.
    ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), {'a', 'b', 'c'}, &sig).ok());
    ASSERT_EQ(sig.size(), 256u);
    ASSERT_TRUE(openssl(Op::VerifyRecover, pub.get(), {RSA_PKCS1_PADDING}, {}, &recovered, sig));
    EXPECT_EQ(recovered, Bytes({'a', 'b', 'c'}));
    EXPECT_TRUE(ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), {'a', 'b', 'c'}, &none, sig).ok());
    EXPECT_EQ(ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), {'a', 'b', 'd'}, &none, sig).error,
              KM_ERROR_VERIFICATION_FAILED);
    Bytes theirs;
    ASSERT_TRUE(openssl(Op::Sign, priv.get(), {RSA_PKCS1_PADDING}, {'x', 'y'}, &theirs));
    EXPECT_TRUE(ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), {'x', 'y'}, &none, theirs).ok());

    // Raw RSA: the zero-padded message.
    Bytes m = sample(20, 3);
    ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_NONE, 0), m, &sig).ok());
    ASSERT_TRUE(openssl(Op::VerifyRecover, pub.get(), {RSA_NO_PADDING}, {}, &recovered, sig));
    Bytes block(256, 0);
    std::memcpy(block.data() + 236, m.data(), 20);
    EXPECT_EQ(recovered, block);
    EXPECT_TRUE(ta(KM_PURPOSE_VERIFY, blob, op_params(KM_PAD_NONE, 0), m, &none, sig).ok());

    // 245 bytes fit a PKCS#1 block of a 2048-bit key, 246 do not; raw RSA takes 256.
    EXPECT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), sample(245, 1), &sig).ok());
    tee_host::trace::clear();
    EXPECT_EQ(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), sample(246, 1), &sig).error,
              KM_ERROR_INVALID_INPUT_LENGTH);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "rsa_sign_update", "Input too long to sign, key_size 2048, input 246B"));
    Bytes small_value(256, 0);
    small_value[255] = 7;
    EXPECT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_NONE, 0), small_value, &sig).ok());
    EXPECT_EQ(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_NONE, 0), sample(257, 1), &sig).error,
              KM_ERROR_INVALID_INPUT_LENGTH);
    // A raw value not below the modulus is refused by the TEE.
    EXPECT_EQ(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_NONE, 0), Bytes(256, 0xFF), &sig).error,
              KM_ERROR_INVALID_ARGUMENT);
}

TEST_F(Rsa, BeginRefusesPaddingAndDigestCombinations) {
    Bytes blob = import_pem(kRsa1024Pem);
    struct Case {
        uint32_t purpose, padding;
        int digest;
        int32_t error;
    };
    const Case cases[] = {
        {KM_PURPOSE_SIGN, KM_PAD_NONE, KM_DIGEST_SHA_2_256, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_SIGN, KM_PAD_RSA_PSS, KM_DIGEST_MD5, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_SIGN, KM_PAD_RSA_PSS, KM_DIGEST_NONE, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_VERIFY, KM_PAD_RSA_PSS, KM_DIGEST_NONE, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_SIGN, KM_PAD_RSA_OAEP, KM_DIGEST_SHA1, KM_ERROR_UNSUPPORTED_PADDING_MODE},
        {KM_PURPOSE_SIGN, KM_PAD_RSA_PKCS1_1_5_SIGN, -1, KM_ERROR_INVALID_ARGUMENT},
        {KM_PURPOSE_ENCRYPT, KM_PAD_RSA_OAEP, -1, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_ENCRYPT, KM_PAD_RSA_OAEP, KM_DIGEST_MD5, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_DECRYPT, KM_PAD_RSA_PKCS1_1_5_ENCRYPT, KM_DIGEST_SHA_2_256, KM_ERROR_INCOMPATIBLE_DIGEST},
        {KM_PURPOSE_ENCRYPT, KM_PAD_RSA_PSS, KM_DIGEST_SHA1, KM_ERROR_UNSUPPORTED_PADDING_MODE},
    };
    for (const Case &c : cases) {
        uint32_t h = 0;
        tee_host::trace::clear();
        EXPECT_EQ(begin(c.purpose, blob, op_params(c.padding, c.digest), &h).error, c.error)
            << c.purpose << " " << c.padding << " " << c.digest << "\n"
            << dump_log();
        // A record create gives up on is released quietly: nobody freed an invalid record.
        EXPECT_EQ(logged_count("Try to free", true), 0) << dump_log();
    }
    ParamSet twice = op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, KM_DIGEST_SHA1);
    twice.add(KM_TAG_PADDING, KM_PAD_RSA_PSS);
    uint32_t h = 0;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, twice, &h).error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "create_rsa_sign", "No or too many KM_TAG_PADDING"));
    EXPECT_EQ(logged_count("Try to free", true), 0) << dump_log();

    ParamSet soter = key_params();
    soter.add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
    Bytes soter_blob;
    ASSERT_TRUE(import(soter, rsa_material(kRsa1024Pem), &soter_blob).ok());
    // An unprovisioned device has no SOTER state to sign documents with.
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, soter_blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 4), &h).error,
              KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged_message("soter resources is not ready, error 0xffff0008")) << dump_log();
}

// Destroying a complete record names each required member it finds
// missing, once, and still releases the rest.
TEST_F(Rsa, DestroyNamesEachMissingMember) {
    Bytes blob = import_pem(kRsa1024Pem);
    for (int missing = 1; missing <= 3; ++missing) {
        operation_t *op = create_record(blob, KM_ALGORITHM_RSA, KM_PURPOSE_SIGN,
                                        op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, KM_DIGEST_SHA_2_256));
        ASSERT_NE(op, nullptr);
        auto *rec = operation_record<rsa_sign_operation_t>(op);
        // Take away the key object, then the RSA operation, then the message buffer.
        TEE_FreeTransientObject(rec->key);
        rec->key = nullptr;
        if (missing >= 2) {
            TEE_FreeOperation(rec->operation);
            rec->operation = nullptr;
        }
        if (missing >= 3) {
            ta_free(rec->block);
            rec->block = nullptr;
        }
        tee_host::trace::clear();
        operation_destroy(op);
        EXPECT_EQ(logged_count("Try to free invalid rsa_sign_operation_t"), missing) << dump_log();
    }
    tee_host::trace::clear();
    operation_destroy(nullptr);
    EXPECT_TRUE(logged_message("Try to free NULL operation_t"));
}

TEST_F(Rsa, CiphertextsInteroperateBothWays) {
    Bytes blob = import_pem(kRsa2048Pem);
    Pkey priv = load_pem(kRsa2048Pem);
    Pkey pub = exported(blob);
    const Bytes msg = sample(100, 11);
    struct Case {
        uint32_t padding;
        int digest;
        Pad pad;
    };
    std::vector<Case> cases = {{KM_PAD_RSA_PKCS1_1_5_ENCRYPT, -1, {RSA_PKCS1_PADDING}}};
    for (uint32_t d = 2; d <= 6; ++d)
        cases.push_back({KM_PAD_RSA_OAEP, static_cast<int>(d), {RSA_PKCS1_OAEP_PADDING, md_for(d)}});
    for (const Case &c : cases) {
        SCOPED_TRACE(testing::Message() << c.padding << " " << c.digest);
        Bytes ct, pt;
        ASSERT_TRUE(ta(KM_PURPOSE_ENCRYPT, blob, op_params(c.padding, c.digest), msg, &ct).ok()) << dump_log();
        EXPECT_EQ(ct.size(), 256u);
        ASSERT_TRUE(openssl(Op::Decrypt, priv.get(), c.pad, ct, &pt));
        EXPECT_EQ(pt, msg);
        ASSERT_TRUE(openssl(Op::Encrypt, pub.get(), c.pad, msg, &ct));
        ASSERT_TRUE(ta(KM_PURPOSE_DECRYPT, blob, op_params(c.padding, c.digest), ct, &pt).ok());
        EXPECT_EQ(pt, msg);
        ct[5] ^= 1;
        EXPECT_EQ(ta(KM_PURPOSE_DECRYPT, blob, op_params(c.padding, c.digest), ct, &pt).error,
                  KM_ERROR_INVALID_ARGUMENT);
    }
    // Raw RSA: always k bytes, leading zeros restored.
    Bytes small(256, 0);
    small[254] = 1;
    small[255] = 2;
    Bytes ct, pt;
    ASSERT_TRUE(ta(KM_PURPOSE_ENCRYPT, blob, op_params(KM_PAD_NONE), small, &ct).ok());
    ASSERT_TRUE(openssl(Op::Decrypt, priv.get(), {RSA_NO_PADDING}, ct, &pt));
    EXPECT_EQ(pt, small);
    ASSERT_TRUE(ta(KM_PURPOSE_DECRYPT, blob, op_params(KM_PAD_NONE), ct, &pt).ok());
    EXPECT_EQ(pt, small);
    EXPECT_EQ(ta(KM_PURPOSE_DECRYPT, blob, op_params(KM_PAD_NONE), Bytes(256, 0xFF), &pt).error,
              KM_ERROR_INVALID_ARGUMENT);
}

TEST_F(Rsa, EncryptionLimits) {
    Bytes blob = import_pem(kRsa2048Pem);
    Bytes ct;
    struct Case {
        uint32_t padding;
        int digest;
        size_t max;
    };
    const Case cases[] = {{KM_PAD_RSA_PKCS1_1_5_ENCRYPT, -1, 245},
                          {KM_PAD_RSA_OAEP, KM_DIGEST_SHA_2_256, 190},
                          {KM_PAD_RSA_OAEP, KM_DIGEST_SHA_2_512, 126}};
    for (const Case &c : cases) {
        EXPECT_TRUE(ta(KM_PURPOSE_ENCRYPT, blob, op_params(c.padding, c.digest), sample(c.max, 1), &ct).ok()) << c.max;
        tee_host::trace::clear();
        EXPECT_EQ(ta(KM_PURPOSE_ENCRYPT, blob, op_params(c.padding, c.digest), sample(c.max + 1, 1), &ct).error,
                  KM_ERROR_INVALID_INPUT_LENGTH);
        EXPECT_TRUE(logged_message("Message too long, max " + std::to_string(c.max) + "B, got " +
                                   std::to_string(c.max + 1) + "B"))
            << dump_log();
    }
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op_params(KM_PAD_NONE), &h).ok());
    EXPECT_TRUE(update(h, sample(200, 1)).ok());
    uint32_t consumed = 99;
    tee_host::trace::clear();
    EXPECT_EQ(update(h, sample(57, 1), {}, nullptr, &consumed).error, KM_ERROR_INVALID_INPUT_LENGTH);
    EXPECT_EQ(consumed, 0u);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "rsa_encrypt_update", "Input too long to encrypt, key_size 2048, input 257B"));
}

TEST_F(Rsa, SixteenLive4096BitOperationsFitTheHeap) {
    Bytes blob = import_pem(kRsa4096Pem);
    std::vector<uint32_t> handles;
    for (int i = 0; i < 16; ++i) {
        uint32_t h = 0;
        // Unhashed PKCS#1 keeps a message buffer per operation: the largest record.
        ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 0), &h).ok()) << i << dump_log();
        handles.push_back(h);
    }
    const auto st = tee_host::heap::stats();
    EXPECT_LE(st.peak_bytes, st.limit);
    RecordProperty("peak_heap_bytes", static_cast<int>(st.peak_bytes));
    Bytes sig;
    ASSERT_TRUE(update(handles[3], {'h', 'i'}).ok());
    ASSERT_TRUE(finish(handles[3], {}, {}, &sig).ok());
    EXPECT_EQ(sig.size(), 512u);
    handles.erase(handles.begin() + 3);
    for (uint32_t h : handles)
        EXPECT_TRUE(abort(h).ok());
}

TEST_F(Rsa, AllocationFailuresInRsaOperations) {
    Bytes blob = import_pem(kRsa1024Pem);
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    const Outcome provider_oom{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED};
    const Outcome unparsed{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}; // a parameter set not parsed
    const Bytes msg = sample(64, 1);
    Bytes sig, ct;
    ASSERT_TRUE(ta(KM_PURPOSE_SIGN, blob, op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 4), msg, &sig).ok());
    const Bytes secret = sample(32, 2); // within OAEP-SHA-256's room in a 1024-bit key
    ASSERT_TRUE(ta(KM_PURPOSE_ENCRYPT, blob, op_params(KM_PAD_RSA_OAEP, 4), secret, &ct).ok());
    const struct {
        uint32_t purpose;
        const char *name;
        ParamSet params;
        Bytes input;
        Bytes signature;
    } purposes[] = {
        {KM_PURPOSE_SIGN, "sign", op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 4), msg, {}},
        {KM_PURPOSE_VERIFY, "verify", op_params(KM_PAD_RSA_PKCS1_1_5_SIGN, 4), msg, sig},
        {KM_PURPOSE_ENCRYPT, "encrypt", op_params(KM_PAD_RSA_OAEP, 4), secret, {}},
        {KM_PURPOSE_DECRYPT, "decrypt", op_params(KM_PAD_RSA_OAEP, 4), ct, {}},
    };
    const char *steps[] = {"begin", "update", "finish"};
    for (const auto &pp : purposes) {
        for (uint32_t step = 0; step < 3; ++step) {
            uint32_t h = 0;
            std::vector<Outcome> allowed = {oom, provider_oom, unparsed};
            if (step == 0) {
                allowed.push_back({TEE_ERROR_BAD_PARAMETERS, 0});         // begin parameters not parsed
                allowed.push_back({TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR}); // a TEE object or operation not made
            }
            const std::string what = std::string(steps[step]) + " " + pp.name;
            int n = sweep_allocations(
                what,
                [&] {
                    if (step > 0) {
                        ASSERT_TRUE(begin(pp.purpose, blob, pp.params, &h).ok()) << what;
                    }
                    if (step > 1) {
                        ASSERT_TRUE(update(h, pp.input).ok()) << what;
                    }
                },
                [&] {
                    Outcome o{};
                    if (step == 0)
                        o = begin(pp.purpose, blob, pp.params, &h);
                    else if (step == 1)
                        o = update(h, pp.input);
                    else
                        o = finish(h, pp.signature);
                    Outcome after = abort(h);
                    if (tee_host::heap::injected_failure_fired()) {
                        EXPECT_EQ(after.error, KM_ERROR_INVALID_OPERATION_HANDLE) << what << ": a failed step ends it";
                    }
                    return o;
                },
                allowed);
            EXPECT_GT(n, 0) << what;
        }
    }
}

} // namespace
