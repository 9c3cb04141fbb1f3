/*
 * AES through the command interface: keys (import, generation, key data),
 * the published known answers, OpenSSL interoperability under random
 * update splits, the hold-back rules of decryption, begin refusals and
 * the authorization of modes, paddings, nonces and MAC lengths, and
 * memory exhaustion at every allocation.
 */
#include <algorithm>
#include <optional>
#include <random>

#include <openssl/core_names.h>
#include <openssl/evp.h>

#include "aes.h"
#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

Bytes sample(size_t n, uint8_t seed) {
    Bytes b(n);
    for (size_t i = 0; i < n; ++i)
        b[i] = static_cast<uint8_t>(seed + i * 29 + (i >> 7));
    return b;
}

Bytes cat(Bytes a, const Bytes &b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

const EVP_CIPHER *evp_cipher(uint32_t mode, size_t key_bytes) {
    const bool k128 = key_bytes == 16, k192 = key_bytes == 24;
    switch (mode) {
    case KM_MODE_ECB:
        return k128 ? EVP_aes_128_ecb() : k192 ? EVP_aes_192_ecb() : EVP_aes_256_ecb();
    case KM_MODE_CBC:
        return k128 ? EVP_aes_128_cbc() : k192 ? EVP_aes_192_cbc() : EVP_aes_256_cbc();
    case KM_MODE_CTR:
        return k128 ? EVP_aes_128_ctr() : k192 ? EVP_aes_192_ctr() : EVP_aes_256_ctr();
    default:
        return k128 ? EVP_aes_128_gcm() : k192 ? EVP_aes_192_gcm() : EVP_aes_256_gcm();
    }
}

// The same cipher on OpenSSL directly. GCM output is ciphertext then tag;
// decryption takes that layout and gives nullopt for a wrong tag.
std::optional<Bytes> openssl(bool encrypt, uint32_t mode, bool pkcs7, const Bytes &key, const Bytes &iv,
                             const Bytes &in, const Bytes &aad = {}, size_t tag_len = 16) {
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    const bool gcm = mode == KM_MODE_GCM;
    Bytes data = in;
    Bytes tag;
    if (gcm && !encrypt) {
        if (in.size() < tag_len)
            return std::nullopt;
        tag.assign(in.end() - static_cast<long>(tag_len), in.end());
        data.resize(in.size() - tag_len);
    }
    Bytes out(data.size() + 32);
    int len = 0, fin = 0;
    bool ok = EVP_CipherInit_ex2(ctx, evp_cipher(mode, key.size()), key.data(), iv.empty() ? nullptr : iv.data(),
                                 encrypt ? 1 : 0, nullptr) == 1 &&
              EVP_CIPHER_CTX_set_padding(ctx, pkcs7 ? 1 : 0) == 1;
    if (ok && gcm && !aad.empty())
        ok = EVP_CipherUpdate(ctx, nullptr, &len, aad.data(), static_cast<int>(aad.size())) == 1;
    if (ok && gcm && !encrypt) {
        OSSL_PARAM p[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, tag.data(), tag.size()),
                          OSSL_PARAM_construct_end()};
        ok = EVP_CIPHER_CTX_set_params(ctx, p) == 1;
    }
    ok = ok && EVP_CipherUpdate(ctx, out.data(), &len, data.data(), static_cast<int>(data.size())) == 1 &&
         EVP_CipherFinal_ex(ctx, out.data() + len, &fin) == 1;
    out.resize(ok ? static_cast<size_t>(len + fin) : 0);
    if (ok && gcm && encrypt) {
        tag.assign(tag_len, 0);
        OSSL_PARAM p[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, tag.data(), tag.size()),
                          OSSL_PARAM_construct_end()};
        ok = EVP_CIPHER_CTX_get_params(ctx, p) == 1;
        out = cat(out, tag);
    }
    EVP_CIPHER_CTX_free(ctx);
    if (!ok)
        return std::nullopt;
    return out;
}

// Cut points that split n bytes into `pieces` updates (some may be empty).
std::vector<size_t> random_split(std::mt19937 &rng, size_t n, size_t pieces) {
    std::vector<size_t> cuts;
    std::uniform_int_distribution<size_t> at(0, n);
    for (size_t i = 1; i < pieces; ++i)
        cuts.push_back(at(rng));
    std::sort(cuts.begin(), cuts.end());
    cuts.push_back(n);
    return cuts;
}

class Aes : public KeyTest {
  protected:
    // Every mode and padding, GCM tags from 96 bits, caller nonces allowed.
    static ParamSet key_params(uint32_t min_mac = 96) {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add_bool(KM_TAG_NO_AUTH_REQUIRED).add_bool(KM_TAG_CALLER_NONCE);
        p.add(KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT).add(KM_TAG_PURPOSE, KM_PURPOSE_DECRYPT);
        for (uint32_t m : {KM_MODE_ECB, KM_MODE_CBC, KM_MODE_CTR, KM_MODE_GCM})
            p.add(KM_TAG_BLOCK_MODE, m);
        p.add(KM_TAG_PADDING, KM_PAD_NONE).add(KM_TAG_PADDING, KM_PAD_PKCS7);
        p.add(KM_TAG_MIN_MAC_LENGTH, min_mac);
        return p;
    }
    Bytes import_raw(const Bytes &key, ParamSet p = key_params()) {
        Bytes blob;
        EXPECT_TRUE(import(p, key, &blob).ok()) << dump_log();
        return blob;
    }
    static ParamSet op(uint32_t mode, uint32_t padding = KM_PAD_NONE, const Bytes &nonce = {}, uint32_t mac = 0) {
        ParamSet p;
        p.add(KM_TAG_BLOCK_MODE, mode).add(KM_TAG_PADDING, padding);
        if (!nonce.empty())
            p.add_bytes(KM_TAG_NONCE, nonce);
        if (mac)
            p.add(KM_TAG_MAC_LENGTH, mac);
        return p;
    }
    // update with an explicit output capacity.
    Outcome update_into(uint32_t h, const Bytes &data, size_t capacity, Bytes *out, const ParamSet &params = {}) {
        Bytes in;
        km::put_lv(in, data);
        km::put_lv(in, params.serialize());
        Bytes buf(capacity, 0xEE);
        Params p = Params::io(h, 0, &in, &buf);
        TEE_Result res = invoke(KM_CMD_UPDATE, p);
        if (out)
            out->assign(buf.begin(), buf.begin() + p.p[2].memref.size);
        EXPECT_TRUE(res != TEE_SUCCESS || p.p[2].memref.size <= capacity);
        return {res, static_cast<int32_t>(p.p[0].value.a)};
    }
    // begin, one update per piece (cuts are the piece ends), finish: all
    // output concatenated into *out, the nonce begin returned into *nonce.
    Outcome cipher(uint32_t purpose, const Bytes &blob, const ParamSet &params, const Bytes &in,
                   const std::vector<size_t> &cuts, Bytes *out, Bytes *nonce = nullptr, const Bytes &aad = {}) {
        out->clear();
        uint32_t h = 0;
        Bytes out_params;
        Outcome o = begin(purpose, blob, params, &h, &out_params);
        if (!o.ok())
            return o;
        if (nonce) {
            auto set = ParamSet::parse(out_params.data(), out_params.size());
            const km::Param *n = set ? set->find(KM_TAG_NONCE) : nullptr;
            *nonce = n ? n->bytes : Bytes{};
        }
        if (!aad.empty()) {
            ParamSet a;
            a.add_bytes(KM_TAG_ASSOCIATED_DATA, aad);
            if (!(o = update_into(h, {}, 16, nullptr, a)).ok())
                return o;
        }
        size_t from = 0;
        for (size_t to : cuts) {
            Bytes piece(in.begin() + static_cast<long>(from), in.begin() + static_cast<long>(to)), got;
            if (!(o = update_into(h, piece, piece.size() + 32, &got)).ok())
                return o;
            *out = cat(*out, got);
            from = to;
        }
        Bytes last;
        o = finish(h, {}, {}, &last, in.size() + 256);
        *out = cat(*out, last);
        return o;
    }
    Outcome whole(uint32_t purpose, const Bytes &blob, const ParamSet &params, const Bytes &in, Bytes *out,
                  Bytes *nonce = nullptr, const Bytes &aad = {}) {
        return cipher(purpose, blob, params, in, {in.size()}, out, nonce, aad);
    }
};

// ---- keys ---------------------------------------------------------------

TEST_F(Aes, ImportKeepsTheRawKeyBehindItsSize) {
    for (size_t n : {16u, 24u, 32u}) {
        Bytes key = sample(n, 7), blob, chars;
        ParamSet p = key_params();
        ASSERT_TRUE(import(p, key, &blob, &chars).ok()) << dump_log();
        auto set = ParamSet::parse(chars.data(), chars.size());
        ASSERT_TRUE(set);
        EXPECT_EQ(set->find(KM_TAG_KEY_SIZE)->value, n * 8);
        EXPECT_EQ(set->find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);
        uint32_t trusted = open(&trusted_client_uuids[0]);
        Bytes payload;
        ASSERT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
        tee_->close_session(trusted);
        ASSERT_EQ(km::get_u32(payload.data()), n + 4);
        EXPECT_EQ(km::get_u32(payload.data() + 4), n * 8);
        EXPECT_EQ(Bytes(payload.begin() + 8, payload.begin() + 8 + static_cast<long>(n)), key);
    }
}

TEST_F(Aes, ImportRefusals) {
    Bytes blob;
    ParamSet sized = key_params();
    sized.add(KM_TAG_KEY_SIZE, 256);
    EXPECT_EQ(import(sized, sample(16, 1), &blob).error, KM_ERROR_IMPORT_PARAMETER_MISMATCH);
    EXPECT_TRUE(logged_message("Key size mismatch (given 256, guessed 128)")) << dump_log();
    tee_host::trace::clear();
    EXPECT_EQ(import(key_params(), sample(20, 1), &blob).error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "aes_import_key", "Invalid AES key size 160")) << dump_log();
    ParamSet origin = key_params();
    origin.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    EXPECT_EQ(import(origin, sample(16, 1), &blob).error, KM_ERROR_INVALID_ARGUMENT);
    // A key without a GCM minimum imports: the generation rule is not applied.
    ParamSet no_min;
    no_min.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add(KM_TAG_BLOCK_MODE, KM_MODE_GCM);
    EXPECT_TRUE(import(no_min, sample(32, 1), &blob).ok());
    Bytes exported;
    EXPECT_EQ(export_key(key_reference(blob), &exported).error, KM_ERROR_UNSUPPORTED_KEY_FORMAT);
}

TEST_F(Aes, GenerationChecksSizeAndGcmMinimum) {
    auto gen = [&](std::vector<uint32_t> modes, int min_mac, uint32_t size = 128) {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add(KM_TAG_KEY_SIZE, size);
        for (uint32_t m : modes)
            p.add(KM_TAG_BLOCK_MODE, m);
        if (min_mac >= 0)
            p.add(KM_TAG_MIN_MAC_LENGTH, static_cast<uint32_t>(min_mac));
        Bytes blob;
        return generate(p, &blob).error;
    };
    for (uint32_t size : {128u, 192u, 256u})
        EXPECT_EQ(gen({KM_MODE_CBC}, -1, size), KM_ERROR_OK) << size;
    tee_host::trace::clear();
    EXPECT_EQ(gen({KM_MODE_CBC}, -1, 64), KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged_message("Invalid AES key size 64"));
    for (int bad : {100, 88, 136})
        EXPECT_EQ(gen({KM_MODE_CBC, KM_MODE_GCM}, bad), KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH) << bad;
    for (int good : {96, 104, 128})
        EXPECT_EQ(gen({KM_MODE_CBC, KM_MODE_GCM}, good), KM_ERROR_OK) << good;
    EXPECT_EQ(gen({KM_MODE_GCM}, -1), KM_ERROR_MISSING_MIN_MAC_LENGTH);
    EXPECT_EQ(gen({}, -1), KM_ERROR_MISSING_MIN_MAC_LENGTH);
    EXPECT_EQ(gen({}, 96), KM_ERROR_OK);
    // Without GCM the minimum is not looked at, whatever it says.
    EXPECT_EQ(gen({KM_MODE_CTR}, 100), KM_ERROR_OK);

    ParamSet twice;
    twice.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add(KM_TAG_KEY_SIZE, 128).add(KM_TAG_KEY_SIZE, 128);
    twice.add(KM_TAG_BLOCK_MODE, KM_MODE_CBC);
    Bytes blob;
    EXPECT_EQ(generate(twice, &blob).error, KM_ERROR_INVALID_ARGUMENT);
}

// A generated key is a real key: its bytes (read through the trusted
// session) decrypt the TA's ciphertext in OpenSSL.
TEST_F(Aes, GeneratedKeyEncryptsLikeOpenSsl) {
    ParamSet p = key_params();
    p.add(KM_TAG_KEY_SIZE, 192);
    Bytes blob, chars;
    ASSERT_TRUE(generate(p, &blob).ok()) << dump_log();
    uint32_t trusted = open(&trusted_client_uuids[0]);
    Bytes payload;
    ASSERT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
    tee_->close_session(trusted);
    ASSERT_EQ(km::get_u32(payload.data()), 28u);
    Bytes key(payload.begin() + 8, payload.begin() + 8 + 24);
    EXPECT_NE(key, Bytes(24, 0));
    Bytes msg = sample(45, 3), ct, nonce;
    ASSERT_TRUE(whole(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7), msg, &ct, &nonce).ok());
    ASSERT_EQ(nonce.size(), 16u);
    EXPECT_EQ(openssl(false, KM_MODE_CBC, true, key, nonce, ct), msg);
}

TEST_F(Aes, ShortKeyDataDoesNotResolve) {
    Bytes data = cat(hex("80000000"), sample(15, 1)); // says 128 bits, holds 120
    TEE_ObjectHandle obj = nullptr;
    uint32_t size = 99;
    int32_t error = 5;
    EXPECT_EQ(aes_resolve_key_data(data.data(), static_cast<uint32_t>(data.size()), &obj, &size, &error),
              TEE_ERROR_GENERIC);
    EXPECT_EQ(obj, nullptr);
    EXPECT_EQ(size, 0u);
    EXPECT_EQ(aes_resolve_key_data(data.data(), 3, &obj, nullptr, &error), TEE_ERROR_GENERIC);
    data.push_back(0);
    ASSERT_EQ(aes_resolve_key_data(data.data(), static_cast<uint32_t>(data.size()), &obj, &size, &error), TEE_SUCCESS);
    EXPECT_EQ(size, 128u);
    EXPECT_EQ(error, 0);
    TEE_FreeTransientObject(obj);
}

// ---- known answers ------------------------------------------------------

struct Kat {
    const char *name;
    uint32_t mode;
    const char *key, *iv, *plain, *cipher;
};

const char kSp38aPlain[] = "6bc1bee22e409f96e93d7e117393172a ae2d8a571e03ac9c9eb76fac45af8e51"
                           "30c81c46a35ce411e5fbc1191a0a52ef f69f2445df4f9b17ad2b417be66c3710";
const char kK128[] = "2b7e151628aed2a6abf7158809cf4f3c";
const char kK192[] = "8e73b0f7da0e6452c810f32b809079e562f8ead2522c6b7b";
const char kK256[] = "603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4";
const char kCbcIv[] = "000102030405060708090a0b0c0d0e0f";
const char kCtrIv[] = "f0f1f2f3f4f5f6f7f8f9fafbfcfdfeff";

const Kat kKats[] = {
    {"FIPS-197 C.1", KM_MODE_ECB, "000102030405060708090a0b0c0d0e0f", "", "00112233445566778899aabbccddeeff",
     "69c4e0d86a7b0430d8cdb78070b4c55a"},
    {"FIPS-197 C.2", KM_MODE_ECB, "000102030405060708090a0b0c0d0e0f1011121314151617", "",
     "00112233445566778899aabbccddeeff", "dda97ca4864cdfe06eaf70a0ec0d7191"},
    {"FIPS-197 C.3", KM_MODE_ECB, "000102030405060708090a0b0c0d0e0f101112131415161718191a1b1c1d1e1f", "",
     "00112233445566778899aabbccddeeff", "8ea2b7ca516745bfeafc49904b496089"},
    {"F.1.1 ECB-AES128", KM_MODE_ECB, kK128, "", kSp38aPlain,
     "3ad77bb40d7a3660a89ecaf32466ef97 f5d3d58503b9699de785895a96fdbaaf"
     "43b1cd7f598ece23881b00e3ed030688 7b0c785e27e8ad3f8223207104725dd4"},
    {"F.1.3 ECB-AES192", KM_MODE_ECB, kK192, "", kSp38aPlain,
     "bd334f1d6e45f25ff712a214571fa5cc 974104846d0ad3ad7734ecb3ecee4eef"
     "ef7afd2270e2e60adce0ba2face6444e 9a4b41ba738d6c72fb16691603c18e0e"},
    {"F.1.5 ECB-AES256", KM_MODE_ECB, kK256, "", kSp38aPlain,
     "f3eed1bdb5d2a03c064b5a7e3db181f8 591ccb10d410ed26dc5ba74a31362870"
     "b6ed21b99ca6f4f9f153e7b1beafed1d 23304b7a39f9f3ff067d8d8f9e24ecc7"},
    {"F.2.1 CBC-AES128", KM_MODE_CBC, kK128, kCbcIv, kSp38aPlain,
     "7649abac8119b246cee98e9b12e9197d 5086cb9b507219ee95db113a917678b2"
     "73bed6b8e3c1743b7116e69e22229516 3ff1caa1681fac09120eca307586e1a7"},
    {"F.2.3 CBC-AES192", KM_MODE_CBC, kK192, kCbcIv, kSp38aPlain,
     "4f021db243bc633d7178183a9fa071e8 b4d9ada9ad7dedf4e5e738763f69145a"
     "571b242012fb7ae07fa9baac3df102e0 08b0e27988598881d920a9e64f5615cd"},
    {"F.2.5 CBC-AES256", KM_MODE_CBC, kK256, kCbcIv, kSp38aPlain,
     "f58c4c04d6e5f1ba779eabfb5f7bfbd6 9cfc4e967edb808d679f777bc6702c7d"
     "39f23369a9d9bacfa530e26304231461 b2eb05e2c39be9fcda6c19078c6a9d1b"},
    {"F.5.1 CTR-AES128", KM_MODE_CTR, kK128, kCtrIv, kSp38aPlain,
     "874d6191b620e3261bef6864990db6ce 9806f66b7970fdff8617187bb9fffdff"
     "5ae4df3edbd5d35e5b4f09020db03eab 1e031dda2fbe03d1792170a0f3009cee"},
    {"F.5.3 CTR-AES192", KM_MODE_CTR, kK192, kCtrIv, kSp38aPlain,
     "1abc932417521ca24f2b0459fe7e6e0b 090339ec0aa6faefd5ccc2c6f4ce8e94"
     "1e36b26bd1ebc670d1bd1d665620abf7 4f78a7f6d29809585a97daec58c6b050"},
    {"F.5.5 CTR-AES256", KM_MODE_CTR, kK256, kCtrIv, kSp38aPlain,
     "601ec313775789a5b7a7f504bbf3d228 f443e3ca4d62b59aca84e990cacaf5c5"
     "2b0930daa23de94ce87017ba2d84988d dfc9c58db67aada613c2dd08457941a6"},
};

TEST_F(Aes, PublishedBlockModeVectorsBothWays) {
    for (const Kat &k : kKats) {
        Bytes blob = import_raw(hex(k.key));
        const Bytes plain = hex(k.plain), expected = hex(k.cipher);
        Bytes out;
        // Updates of 7 bytes also cross the block boundaries.
        std::vector<size_t> cuts;
        for (size_t at = 7; at < plain.size(); at += 7)
            cuts.push_back(at);
        cuts.push_back(plain.size());
        ASSERT_TRUE(cipher(KM_PURPOSE_ENCRYPT, blob, op(k.mode, KM_PAD_NONE, hex(k.iv)), plain, cuts, &out).ok())
            << k.name << dump_log();
        EXPECT_EQ(to_hex(out), to_hex(expected)) << k.name;
        ASSERT_TRUE(cipher(KM_PURPOSE_DECRYPT, blob, op(k.mode, KM_PAD_NONE, hex(k.iv)), expected, cuts, &out).ok())
            << k.name;
        EXPECT_EQ(to_hex(out), to_hex(plain)) << k.name;
    }
}

struct GcmKat {
    const char *name;
    const char *key, *iv, *plain, *aad, *cipher, *tag;
};

const char kGcmPlain[] = "d9313225f88406e5a55909c5aff5269a86a7a9531534f7da2e4c303d8a318a72"
                         "1c3c0c95956809532fcf0e2449a6b525b16aedf5aa0de657ba637b391aafd255";
const char kGcmPlain60[] = "d9313225f88406e5a55909c5aff5269a86a7a9531534f7da2e4c303d8a318a72"
                           "1c3c0c95956809532fcf0e2449a6b525b16aedf5aa0de657ba637b39";
const char kGcmAad[] = "feedfacedeadbeeffeedfacedeadbeefabaddad2";
const char kGcmIv[] = "cafebabefacedbaddecaf888";
const char kZeroIv[] = "000000000000000000000000";

const GcmKat kGcmKats[] = {
    {"TC1", "00000000000000000000000000000000", kZeroIv, "", "", "", "58e2fccefa7e3061367f1d57a4e7455a"},
    {"TC2", "00000000000000000000000000000000", kZeroIv, "00000000000000000000000000000000", "",
     "0388dace60b6a392f328c2b971b2fe78", "ab6e47d42cec13bdf53a67b21257bddf"},
    {"TC3", "feffe9928665731c6d6a8f9467308308", kGcmIv, kGcmPlain, "",
     "42831ec2217774244b7221b784d0d49ce3aa212f2c02a4e035c17e2329aca12e"
     "21d514b25466931c7d8f6a5aac84aa051ba30b396a0aac973d58e091473f5985",
     "4d5c2af327cd64a62cf35abd2ba6fab4"},
    {"TC4", "feffe9928665731c6d6a8f9467308308", kGcmIv, kGcmPlain60, kGcmAad,
     "42831ec2217774244b7221b784d0d49ce3aa212f2c02a4e035c17e2329aca12e"
     "21d514b25466931c7d8f6a5aac84aa051ba30b396a0aac973d58e091",
     "5bc94fbc3221a5db94fae95ae7121a47"},
    {"TC8", "000000000000000000000000000000000000000000000000", kZeroIv, "00000000000000000000000000000000", "",
     "98e7247c07f0fe411c267e4384b0f600", "2ff58d80033927ab8ef4d4587514f0fb"},
    {"TC9", "feffe9928665731c6d6a8f9467308308feffe9928665731c", kGcmIv, kGcmPlain, "",
     "3980ca0b3c00e841eb06fac4872a2757859e1ceaa6efd984628593b40ca1e19c"
     "7d773d00c144c525ac619d18c84a3f4718e2448b2fe324d9ccda2710acade256",
     "9924a7c8587336bfb118024db8674a14"},
    {"TC13", "0000000000000000000000000000000000000000000000000000000000000000", kZeroIv, "", "", "",
     "530f8afbc74536b9a963b4f1c4cb738b"},
    {"TC14", "0000000000000000000000000000000000000000000000000000000000000000", kZeroIv,
     "00000000000000000000000000000000", "", "cea7403d4d606b6e074ec5d3baf39d18", "d0d1c8a799996bf0265b98b5d48ab919"},
    {"TC15", "feffe9928665731c6d6a8f9467308308feffe9928665731c6d6a8f9467308308", kGcmIv, kGcmPlain, "",
     "522dc1f099567d07f47f37a32a84427d643a8cdcbfe5c0c97598a2bd2555d1aa"
     "8cb08e48590dbb3da7b08b1056828838c5f61e6393ba7a0abcc9f662898015ad",
     "b094dac5d93471bdec1a502270e3cc6c"},
    {"TC16", "feffe9928665731c6d6a8f9467308308feffe9928665731c6d6a8f9467308308", kGcmIv, kGcmPlain60, kGcmAad,
     "522dc1f099567d07f47f37a32a84427d643a8cdcbfe5c0c97598a2bd2555d1aa"
     "8cb08e48590dbb3da7b08b1056828838c5f61e6393ba7a0abcc9f662",
     "76fc6ece0f4e1768cddf8853bb2d551b"},
};

// Each vector at every tag length from 96 to 128 bits: a shorter tag is
// the leading bytes of the full one.
TEST_F(Aes, PublishedGcmVectorsAtEveryTagLength) {
    for (const GcmKat &k : kGcmKats) {
        Bytes blob = import_raw(hex(k.key));
        const Bytes plain = hex(k.plain), aad = hex(k.aad), ct = hex(k.cipher), tag = hex(k.tag);
        for (uint32_t bits = 96; bits <= 128; bits += 8) {
            const Bytes expected = cat(ct, Bytes(tag.begin(), tag.begin() + bits / 8));
            Bytes out;
            ASSERT_TRUE(whole(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, hex(k.iv), bits), plain, &out,
                              nullptr, aad)
                            .ok())
                << k.name << " " << bits << dump_log();
            EXPECT_EQ(to_hex(out), to_hex(expected)) << k.name << " " << bits;
            ASSERT_TRUE(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, hex(k.iv), bits), expected, &out,
                              nullptr, aad)
                            .ok())
                << k.name << " " << bits << dump_log();
            EXPECT_EQ(to_hex(out), to_hex(plain)) << k.name << " " << bits;
        }
    }
}

// ---- OpenSSL interoperability --------------------------------------------

struct ModeCase {
    uint32_t mode;
    uint32_t padding;
};

const ModeCase kModeCases[] = {{KM_MODE_ECB, KM_PAD_NONE},  {KM_MODE_ECB, KM_PAD_PKCS7}, {KM_MODE_CBC, KM_PAD_NONE},
                               {KM_MODE_CBC, KM_PAD_PKCS7}, {KM_MODE_CTR, KM_PAD_NONE},  {KM_MODE_GCM, KM_PAD_NONE}};

// Every key size and mode, both directions, with the input split at random
// points (seeded) into 1 to 50 updates: the output is byte-identical to
// OpenSSL's and to the one-update output.
TEST_F(Aes, InteroperatesWithOpenSslUnderAnySplit) {
    std::mt19937 rng(20240611);
    std::uniform_int_distribution<size_t> pieces(1, 50);
    for (size_t key_len : {16u, 24u, 32u}) {
        const Bytes key = sample(key_len, static_cast<uint8_t>(key_len));
        const Bytes blob = import_raw(key);
        for (const ModeCase &c : kModeCases) {
            const bool aligned_only = c.padding == KM_PAD_NONE && (c.mode == KM_MODE_ECB || c.mode == KM_MODE_CBC);
            const bool gcm = c.mode == KM_MODE_GCM;
            const bool pkcs7 = c.padding == KM_PAD_PKCS7;
            for (size_t len : {0u, 1u, 15u, 16u, 17u, 32u, 33u, 160u, 1000u}) {
                if (aligned_only && len % 16)
                    continue;
                const std::string what = std::to_string(key_len * 8) + " mode " + std::to_string(c.mode) + " pad " +
                                         std::to_string(c.padding) + " len " + std::to_string(len);
                const Bytes msg = sample(len, static_cast<uint8_t>(len));
                const Bytes aad = gcm ? sample(len % 23, 9) : Bytes{};
                const uint32_t mac = gcm ? 96 + 8 * static_cast<uint32_t>(len % 5) : 0;
                Bytes ct, nonce;
                ASSERT_TRUE(whole(KM_PURPOSE_ENCRYPT, blob, op(c.mode, c.padding, {}, mac), msg, &ct, &nonce, aad).ok())
                    << what << dump_log();
                EXPECT_EQ(nonce.size(), c.mode == KM_MODE_ECB ? 0u : gcm ? 12u : 16u) << what;
                EXPECT_EQ(openssl(false, c.mode, pkcs7, key, nonce, ct, aad, mac / 8), msg) << what;

                // The same nonce given back, and a random split, gives the same bytes.
                const ParamSet with_nonce = op(c.mode, c.padding, nonce, mac);
                Bytes split_ct;
                ASSERT_TRUE(cipher(KM_PURPOSE_ENCRYPT, blob, with_nonce, msg, random_split(rng, len, pieces(rng)),
                                   &split_ct, nullptr, aad)
                                .ok())
                    << what;
                EXPECT_EQ(split_ct, ct) << what;

                // OpenSSL's ciphertext of another message decrypts in the TA under any split.
                const Bytes other = sample(len, static_cast<uint8_t>(len + 101));
                const auto theirs = openssl(true, c.mode, pkcs7, key, nonce, other, aad, mac / 8);
                ASSERT_TRUE(theirs) << what;
                Bytes plain;
                ASSERT_TRUE(cipher(KM_PURPOSE_DECRYPT, blob, with_nonce, *theirs,
                                   random_split(rng, theirs->size(), pieces(rng)), &plain, nullptr, aad)
                                .ok())
                    << what << dump_log();
                EXPECT_EQ(plain, other) << what;
            }
        }
    }
}

// ---- streaming and hold-back rules ---------------------------------------

TEST_F(Aes, CbcPaddingAndBlockLengths) {
    const Bytes key = sample(16, 1), iv = sample(16, 2);
    const Bytes blob = import_raw(key);
    uint32_t h = 0;
    Bytes got;
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), &h).ok());
    ASSERT_TRUE(update_into(h, sample(32, 3), 64, &got).ok());
    EXPECT_EQ(got.size(), 32u);
    Bytes last;
    ASSERT_TRUE(finish(h, {}, {}, &last).ok());
    ASSERT_EQ(last.size(), 16u);
    // The extra block is a whole block of padding chained on the last ciphertext block.
    Bytes chain(got.end() - 16, got.end());
    EXPECT_EQ(openssl(true, KM_MODE_CBC, false, key, chain, Bytes(16, 16)), last);

    tee_host::trace::clear();
    EXPECT_EQ(whole(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC, KM_PAD_NONE, iv), sample(20, 1), &got).error,
              KM_ERROR_INVALID_INPUT_LENGTH);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "aes_encrypt_finish", "Input length 20B not a multiple of the block size"));
    EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_ECB, KM_PAD_NONE), sample(20, 1), &got).error,
              KM_ERROR_INVALID_INPUT_LENGTH);
    EXPECT_TRUE(logged_message("Input data not align to block size"));
    EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), sample(33, 1), &got).error,
              KM_ERROR_INVALID_INPUT_LENGTH);
    ASSERT_TRUE(whole(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CTR, KM_PAD_NONE, iv), sample(20, 1), &got).ok());
    EXPECT_EQ(got.size(), 20u);
}

TEST_F(Aes, Pkcs7DecryptionHoldsBackTheLastBlock) {
    const Bytes key = sample(32, 4), iv = sample(16, 5);
    const Bytes blob = import_raw(key);
    // Exactly one block: update says nothing, finish gives the unpadded bytes.
    const Bytes one = *openssl(true, KM_MODE_CBC, true, key, iv, sample(11, 6));
    ASSERT_EQ(one.size(), 16u);
    uint32_t h = 0;
    Bytes got;
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), &h).ok());
    ASSERT_TRUE(update_into(h, one, 64, &got).ok());
    EXPECT_TRUE(got.empty());
    ASSERT_TRUE(finish(h, {}, {}, &got).ok());
    EXPECT_EQ(got, sample(11, 6));

    // A held block needs 16 bytes of room in the next update: 8 is refused
    // and the operation is gone.
    const Bytes three = *openssl(true, KM_MODE_CBC, true, key, iv, sample(40, 6));
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), &h).ok());
    ASSERT_TRUE(update_into(h, Bytes(three.begin(), three.begin() + 16), 64, &got).ok());
    EXPECT_TRUE(got.empty());
    Bytes rest(three.begin() + 16, three.begin() + 20);
    EXPECT_EQ(update_into(h, rest, 8, &got), (Outcome{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED}));
    EXPECT_TRUE(got.empty());
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    // With room the held block comes out first, and nothing is lost.
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), &h).ok());
    ASSERT_TRUE(update_into(h, Bytes(three.begin(), three.begin() + 16), 64, &got).ok());
    ASSERT_TRUE(update_into(h, rest, 16, &got).ok());
    const Bytes msg = sample(40, 6);
    EXPECT_EQ(got, Bytes(msg.begin(), msg.begin() + 16));
    Bytes tail;
    ASSERT_TRUE(update_into(h, Bytes(three.begin() + 20, three.end()), 64, &tail).ok());
    Bytes fin;
    ASSERT_TRUE(finish(h, {}, {}, &fin).ok());
    EXPECT_EQ(cat(cat(got, tail), fin), msg);
}

TEST_F(Aes, IllegalPaddingIsRefused) {
    const Bytes key = sample(16, 8);
    const Bytes blob = import_raw(key);
    auto block_ending = [&](std::vector<uint8_t> tail) {
        Bytes b = sample(16, 9);
        std::copy(tail.begin(), tail.end(), b.end() - static_cast<long>(tail.size()));
        return *openssl(true, KM_MODE_ECB, false, key, {}, b);
    };
    struct Case {
        const char *name;
        std::vector<uint8_t> tail;
    } cases[] = {{"last byte 0", {0}}, {"last byte 17", {17}}, {"short run", {1, 2, 3}}, {"16 but one", {15, 16}}};
    for (const Case &c : cases) {
        tee_host::trace::clear();
        Bytes got;
        EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_ECB, KM_PAD_PKCS7), block_ending(c.tail), &got).error,
                  KM_ERROR_INVALID_ARGUMENT)
            << c.name;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "aes_decrypt_finish", "Illegal padding")) << c.name;
    }
    Bytes full = block_ending(std::vector<uint8_t>(16, 16)), got;
    ASSERT_TRUE(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_ECB, KM_PAD_PKCS7), full, &got).ok());
    EXPECT_TRUE(got.empty());
    tee_host::trace::clear();
    EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_ECB, KM_PAD_PKCS7), {}, &got).error,
              KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged_message("Illegal padding"));
}

TEST_F(Aes, GcmDecryptionHoldsBackTheTag) {
    const Bytes key = sample(16, 10), nonce = sample(12, 11), msg = sample(40, 12);
    const Bytes blob = import_raw(key);
    const Bytes sealed = *openssl(true, KM_MODE_GCM, false, key, nonce, msg, {}, 13);
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 104), &h).ok());
    Bytes plain;
    for (size_t i = 0; i < sealed.size(); ++i) {
        Bytes got;
        ASSERT_TRUE(update_into(h, {sealed[i]}, 1, &got).ok()) << i;
        // Nothing until more than T = 13 bytes have come, then one byte per byte.
        EXPECT_EQ(got.size(), i < 13 ? 0u : 1u) << i;
        plain = cat(plain, got);
    }
    Bytes rest;
    ASSERT_TRUE(finish(h, {}, {}, &rest).ok()) << dump_log();
    EXPECT_TRUE(rest.empty());
    EXPECT_EQ(plain, msg);

    // Pieces shorter than the tag that spill out of the buffer.
    ASSERT_TRUE(cipher(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 104), sealed,
                       {5, 17, 20, 30, 41, 50, sealed.size()}, &plain)
                    .ok());
    EXPECT_EQ(plain, msg);

    // Any flipped bit, in the tag or the ciphertext, fails at finish.
    for (size_t bit : {size_t{0}, size_t{8 * 20 + 3}, 8 * (sealed.size() - 1) + 7}) {
        Bytes bad = sealed;
        bad[bit / 8] ^= static_cast<uint8_t>(1u << (bit % 8));
        EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 104), bad, &plain).error,
                  KM_ERROR_VERIFICATION_FAILED)
            << bit;
    }
    // Input shorter than the tag has no tag to check.
    EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 104),
                    Bytes(sealed.begin(), sealed.begin() + 12), &plain)
                  .error,
              KM_ERROR_VERIFICATION_FAILED);
    // Another tag length than the one sealed with does not verify either.
    EXPECT_EQ(whole(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 96), sealed, &plain).error,
              KM_ERROR_VERIFICATION_FAILED);
}

TEST_F(Aes, GcmAssociatedDataComesFirst) {
    const Bytes key = sample(32, 13), nonce = sample(12, 14);
    const Bytes blob = import_raw(key);
    // AAD in two pieces equals the AAD whole.
    uint32_t h = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 128), &h).ok());
    ParamSet a1, a2;
    a1.add_bytes(KM_TAG_ASSOCIATED_DATA, Bytes{'h', 'e', 'a', 'd'});
    a2.add_bytes(KM_TAG_ASSOCIATED_DATA, Bytes{'e', 'r'});
    ASSERT_TRUE(update_into(h, {}, 16, nullptr, a1).ok());
    ASSERT_TRUE(update_into(h, {}, 16, nullptr, a2).ok());
    Bytes ct, tag;
    ASSERT_TRUE(update_into(h, sample(10, 1), 16, &ct).ok());
    EXPECT_EQ(update_into(h, {}, 16, nullptr, a2).error, KM_ERROR_INVALID_TAG);
    EXPECT_EQ(abort(h).error, KM_ERROR_INVALID_OPERATION_HANDLE);
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 128), &h).ok());
    ASSERT_TRUE(update_into(h, {}, 16, nullptr, a1).ok());
    ASSERT_TRUE(update_into(h, {}, 16, nullptr, a2).ok());
    ASSERT_TRUE(update_into(h, sample(10, 1), 16, &ct).ok());
    ASSERT_TRUE(finish(h, {}, {}, &tag).ok());
    EXPECT_EQ(tag.size(), 16u);
    EXPECT_EQ(openssl(false, KM_MODE_GCM, false, key, nonce, cat(ct, tag), Bytes{'h', 'e', 'a', 'd', 'e', 'r'}),
              sample(10, 1));
    // Decryption refuses late AAD the same way; CBC refuses AAD at all.
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 128), &h).ok());
    ASSERT_TRUE(update_into(h, cat(ct, tag), 64, nullptr).ok());
    EXPECT_EQ(update_into(h, {}, 16, nullptr, a1).error, KM_ERROR_INVALID_TAG);
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC), &h).ok());
    EXPECT_EQ(update_into(h, {}, 16, nullptr, a1).error, KM_ERROR_INVALID_TAG);
}

// ---- begin refusals and authorization --------------------------------------

TEST_F(Aes, BeginChecksNonceModeAndMacLength) {
    const Bytes blob = import_raw(sample(16, 15));
    uint32_t h = 0;
    Bytes out_params;
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, {}, 128), &h, &out_params).ok());
    auto set = ParamSet::parse(out_params.data(), out_params.size());
    ASSERT_TRUE(set && set->find(KM_TAG_NONCE));
    EXPECT_EQ(set->find(KM_TAG_NONCE)->bytes.size(), 12u);
    Bytes tag;
    ASSERT_TRUE(finish(h, {}, {}, &tag).ok());
    EXPECT_EQ(tag.size(), 16u);
    // ECB hands back no nonce.
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_ECB), &h, &out_params).ok());
    set = ParamSet::parse(out_params.data(), out_params.size());
    EXPECT_TRUE(set && !set->find(KM_TAG_NONCE));
    EXPECT_TRUE(abort(h).ok());

    struct Case {
        const char *name;
        uint32_t purpose;
        ParamSet params;
        int32_t error;
        const char *log;
    };
    ParamSet no_mode;
    no_mode.add(KM_TAG_PADDING, KM_PAD_NONE);
    ParamSet no_mac = op(KM_MODE_GCM);
    const Case cases[] = {
        {"GCM 16-byte nonce", KM_PURPOSE_ENCRYPT, op(KM_MODE_GCM, KM_PAD_NONE, Bytes(16, 1), 128),
         KM_ERROR_INVALID_ARGUMENT, "Invalid nonce length 16, expected 12"},
        {"CBC 8-byte nonce", KM_PURPOSE_DECRYPT, op(KM_MODE_CBC, KM_PAD_NONE, Bytes(8, 1)), KM_ERROR_INVALID_ARGUMENT,
         nullptr},
        {"ECB nonce", KM_PURPOSE_DECRYPT, op(KM_MODE_ECB, KM_PAD_NONE, Bytes(16, 1)), KM_ERROR_INVALID_TAG, nullptr},
        {"no block mode", KM_PURPOSE_ENCRYPT, no_mode, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_BLOCK_MODE"},
        {"GCM without MAC length", KM_PURPOSE_ENCRYPT, no_mac, KM_ERROR_INVALID_ARGUMENT,
         "No or too many KM_TAG_MAC_LENGTH"},
        {"MAC length 129", KM_PURPOSE_ENCRYPT, op(KM_MODE_GCM, KM_PAD_NONE, {}, 129), KM_ERROR_UNSUPPORTED_MAC_LENGTH,
         "Unsupported mac length 129"},
        {"MAC length 100", KM_PURPOSE_DECRYPT, op(KM_MODE_GCM, KM_PAD_NONE, {}, 100), KM_ERROR_UNSUPPORTED_MAC_LENGTH,
         "Unsupported mac length 100"},
        {"CTR with PKCS7", KM_PURPOSE_ENCRYPT, op(KM_MODE_CTR, KM_PAD_PKCS7), KM_ERROR_INCOMPATIBLE_PADDING_MODE,
         nullptr},
        {"GCM with PKCS7", KM_PURPOSE_DECRYPT, op(KM_MODE_GCM, KM_PAD_PKCS7, {}, 128),
         KM_ERROR_INCOMPATIBLE_PADDING_MODE, nullptr},
    };
    for (const Case &c : cases) {
        tee_host::trace::clear();
        EXPECT_EQ(begin(c.purpose, blob, c.params, &h).error, c.error) << c.name << dump_log();
        EXPECT_EQ(h, 0u) << c.name;
        if (c.log) {
            EXPECT_TRUE(logged_message(c.log)) << c.name << dump_log();
        }
    }

    // A block mode the key lists but AES does not have.
    ParamSet odd = key_params();
    odd.add(KM_TAG_BLOCK_MODE, 4);
    const Bytes odd_blob = import_raw(sample(16, 15), odd);
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, odd_blob, op(4), &h).error, KM_ERROR_UNSUPPORTED_BLOCK_MODE);
}

TEST_F(Aes, AuthorizationOfModesPaddingsNoncesAndMacLengths) {
    ParamSet narrow;
    narrow.add(KM_TAG_ALGORITHM, KM_ALGORITHM_AES).add_bool(KM_TAG_NO_AUTH_REQUIRED);
    narrow.add(KM_TAG_PURPOSE, KM_PURPOSE_ENCRYPT).add(KM_TAG_PURPOSE, KM_PURPOSE_DECRYPT);
    narrow.add(KM_TAG_BLOCK_MODE, KM_MODE_CBC).add(KM_TAG_BLOCK_MODE, KM_MODE_GCM);
    narrow.add(KM_TAG_PADDING, KM_PAD_NONE).add(KM_TAG_MIN_MAC_LENGTH, 112);
    const Bytes blob = import_raw(sample(16, 16), narrow);
    uint32_t h = 0;
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_ECB), &h).error, KM_ERROR_INCOMPATIBLE_BLOCK_MODE);
    EXPECT_TRUE(logged_message("No such block mode in key_params"));
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC, KM_PAD_PKCS7), &h).error,
              KM_ERROR_INCOMPATIBLE_PADDING_MODE);
    EXPECT_TRUE(logged_message("No such padding in key_params"));
    // No KM_TAG_CALLER_NONCE: the caller may not choose an encryption nonce,
    // but decryption must be able to name the one used.
    tee_host::trace::clear();
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_CBC, KM_PAD_NONE, Bytes(16, 1)), &h).error,
              KM_ERROR_CALLER_NONCE_PROHIBITED);
    EXPECT_TRUE(logged_message("Caller nonce prohibited"));
    ASSERT_TRUE(begin(KM_PURPOSE_DECRYPT, blob, op(KM_MODE_CBC, KM_PAD_NONE, Bytes(16, 1)), &h).ok());
    EXPECT_TRUE(abort(h).ok());
    // MAC lengths below the key's minimum are refused, at it they pass.
    EXPECT_EQ(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, {}, 104), &h).error,
              KM_ERROR_INVALID_MAC_LENGTH);
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, blob, op(KM_MODE_GCM, KM_PAD_NONE, {}, 112), &h).ok());
    EXPECT_TRUE(abort(h).ok());
    // The same key with the caller-nonce tag accepts a chosen nonce.
    ParamSet caller = narrow;
    caller.add_bool(KM_TAG_CALLER_NONCE);
    const Bytes caller_blob = import_raw(sample(16, 16), caller);
    ASSERT_TRUE(begin(KM_PURPOSE_ENCRYPT, caller_blob, op(KM_MODE_CBC, KM_PAD_NONE, Bytes(16, 1)), &h).ok());
    EXPECT_TRUE(abort(h).ok());
}

// ---- memory ----------------------------------------------------------------

TEST_F(Aes, AllocationFailuresLeaveNothingBehind) {
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    const Outcome unparsed{TEE_ERROR_BAD_PARAMETERS, 0};
    const Outcome provider_oom{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED};
    const Outcome bad_params{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT};
    const Outcome unknown{TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR};
    ParamSet gen = key_params();
    gen.add(KM_TAG_KEY_SIZE, 256);
    EXPECT_GT(sweep_allocations("generate", nullptr,
                                [&] {
                                    Bytes b;
                                    return generate(gen, &b);
                                },
                                {oom, unparsed}),
              0);
    EXPECT_GT(sweep_allocations("import", nullptr,
                                [&] {
                                    Bytes b;
                                    return import(key_params(), sample(32, 1), &b);
                                },
                                {oom, unparsed, provider_oom}),
              0);

    const Bytes key = sample(32, 17), nonce = sample(12, 18), iv = sample(16, 18);
    const Bytes blob = import_raw(key);
    const Bytes sealed = *openssl(true, KM_MODE_GCM, false, key, nonce, sample(70, 19), {}, 16);
    const Bytes padded = *openssl(true, KM_MODE_CBC, true, key, iv, sample(70, 19));
    struct Flow {
        const char *name;
        uint32_t purpose;
        ParamSet params;
        Bytes input;
    };
    const Flow flows[] = {
        {"GCM decrypt", KM_PURPOSE_DECRYPT, op(KM_MODE_GCM, KM_PAD_NONE, nonce, 128), sealed},
        {"GCM encrypt", KM_PURPOSE_ENCRYPT, op(KM_MODE_GCM, KM_PAD_NONE, {}, 128), sample(70, 19)},
        {"CBC PKCS7 decrypt", KM_PURPOSE_DECRYPT, op(KM_MODE_CBC, KM_PAD_PKCS7, iv), padded},
        {"CBC PKCS7 encrypt", KM_PURPOSE_ENCRYPT, op(KM_MODE_CBC, KM_PAD_PKCS7), sample(70, 19)},
    };
    for (const Flow &f : flows) {
        for (int step = 0; step < 3; ++step) {
            uint32_t h = 0;
            std::vector<Outcome> allowed = {oom, provider_oom, bad_params};
            if (step == 0) {
                allowed.push_back(unparsed); // begin parameters not parsed
                allowed.push_back(unknown);  // a record, object or operation not made
            }
            const std::string what = std::string(f.name) + " step " + std::to_string(step);
            int n = sweep_allocations(
                what,
                [&] {
                    if (step > 0) {
                        ASSERT_TRUE(begin(f.purpose, blob, f.params, &h).ok());
                    }
                    if (step > 1) {
                        ASSERT_TRUE(update_into(h, f.input, f.input.size() + 32, nullptr).ok());
                    }
                },
                [&] {
                    Outcome o{};
                    if (step == 0)
                        o = begin(f.purpose, blob, f.params, &h);
                    else if (step == 1)
                        o = update_into(h, f.input, f.input.size() + 32, nullptr);
                    else
                        o = finish(h);
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
