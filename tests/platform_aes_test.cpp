/*
 * The platform's AES: key objects of the three sizes, the cipher interface
 * in ECB and CBC without padding and in CTR mode, and the authenticated-
 * encryption interface in GCM, against the FIPS-197, SP 800-38A and GCM
 * known answers and against OpenSSL called directly; the GP rules on held
 * blocks, output sizes and tags; and the panics on misuse.
 */
#include <algorithm>
#include <random>

#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>

#include "gp_handles.h"

namespace {

class Aes : public TeeTest {};
using AesDeathTest = Aes;

// splits - n cut into random pieces of 0 to max_piece bytes (zero-length
// updates included), from a seeded generator.
std::vector<size_t> splits(std::mt19937 &rng, size_t n, size_t max_piece) {
    std::vector<size_t> out;
    while (n) {
        size_t piece = std::min<size_t>(n, rng() % (max_piece + 1));
        out.push_back(piece);
        n -= piece;
    }
    return out;
}

// cycled - update sizes taken from `pattern` in turn while they leave
// something of n for the final call.
std::vector<size_t> cycled(std::initializer_list<size_t> pattern, size_t n) {
    std::vector<size_t> out;
    for (size_t i = 0; pattern.size() && pattern.begin()[i % pattern.size()] < n; ++i) {
        out.push_back(pattern.begin()[i % pattern.size()]);
        n -= out.back();
    }
    return out;
}

// ossl_cipher - the whole input through OpenSSL in one call, no padding.
Bytes ossl_cipher(const char *name, const Bytes &key, const Bytes &iv, const Bytes &in, bool encrypt) {
    EVP_CIPHER *cipher = EVP_CIPHER_fetch(nullptr, name, nullptr);
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    Bytes out(in.size() + 16);
    int n = 0, tail = 0;
    EXPECT_EQ(EVP_CipherInit_ex2(ctx, cipher, key.data(), iv.empty() ? nullptr : iv.data(), encrypt, nullptr), 1);
    EVP_CIPHER_CTX_set_padding(ctx, 0);
    EXPECT_EQ(EVP_CipherUpdate(ctx, out.data(), &n, in.data(), static_cast<int>(in.size())), 1);
    EXPECT_EQ(EVP_CipherFinal_ex(ctx, out.data() + n, &tail), 1);
    out.resize(static_cast<size_t>(n + tail));
    EVP_CIPHER_CTX_free(ctx);
    EVP_CIPHER_free(cipher);
    return out;
}

// --- Keys -------------------------------------------------------------------------

TEST_F(Aes, KeysOfEachSizeGeneratePopulateAndReadBack) {
    const char *ecb[] = {"AES-128-ECB", "AES-192-ECB", "AES-256-ECB"};
    Bytes block = hex("00112233445566778899aabbccddeeff");
    for (uint32_t i = 0; i < 3; ++i) {
        uint32_t bits = 128 + 64 * i;
        Obj gen(TEE_TYPE_AES, bits);
        ASSERT_EQ(TEE_GenerateKey(gen, bits, nullptr, 0), TEE_SUCCESS);
        EXPECT_EQ(gen.info().objectSize, bits);
        Bytes secret = gen.buffer(TEE_ATTR_SECRET_VALUE);
        ASSERT_EQ(secret.size(), bits / 8);

        // The generated key is the key the cipher uses.
        Op op(TEE_ALG_AES_ECB_NOPAD, TEE_MODE_ENCRYPT, bits, gen);
        TEE_CipherInit(op, nullptr, 0);
        Bytes out(16);
        uint32_t len = 16;
        ASSERT_EQ(TEE_CipherDoFinal(op, block.data(), 16, out.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(out, ossl_cipher(ecb[i], secret, {}, block, true)) << bits;

        // A populated key reads back as given, in an object of any larger size.
        Key copy(TEE_TYPE_AES, secret, 256);
        EXPECT_EQ(copy.buffer(TEE_ATTR_SECRET_VALUE), secret);
        EXPECT_EQ(copy.info().objectSize, bits);
    }
    for (size_t bytes : {0, 8, 15, 17, 20, 33}) {
        Obj o(TEE_TYPE_AES, 256);
        EXPECT_EQ(o.populate({ref_attr(TEE_ATTR_SECRET_VALUE, Bytes(bytes, 1))}), TEE_ERROR_BAD_PARAMETERS) << bytes;
        EXPECT_EQ(o.info().handleFlags, 0u);
    }
}

// --- ECB, CBC, CTR ----------------------------------------------------------------

const char *kPlain = "6bc1bee22e409f96e93d7e117393172aae2d8a571e03ac9c9eb76fac45af8e51"
                     "30c81c46a35ce411e5fbc1191a0a52eff69f2445df4f9b17ad2b417be66c3710";
const char *kKey128 = "2b7e151628aed2a6abf7158809cf4f3c";
const char *kKey192 = "8e73b0f7da0e6452c810f32b809079e562f8ead2522c6b7b";
const char *kKey256 = "603deb1015ca71be2b73aef0857d77811f352c073b6108d72d9810a30914dff4";
const char *kCbcIv = "000102030405060708090a0b0c0d0e0f";
const char *kCtrIv = "f0f1f2f3f4f5f6f7f8f9fafbfcfdfeff";

struct CipherCase {
    uint32_t alg;
    const char *key;
    const char *iv;
    const char *plain;
    const char *cipher;
};

// FIPS-197 appendix C, then SP 800-38A appendix F, every key size.
const CipherCase kCiphers[] = {
    {TEE_ALG_AES_ECB_NOPAD, "000102030405060708090a0b0c0d0e0f", "", "00112233445566778899aabbccddeeff",
     "69c4e0d86a7b0430d8cdb78070b4c55a"},
    {TEE_ALG_AES_ECB_NOPAD, "000102030405060708090a0b0c0d0e0f1011121314151617", "", "00112233445566778899aabbccddeeff",
     "dda97ca4864cdfe06eaf70a0ec0d7191"},
    {TEE_ALG_AES_ECB_NOPAD, "000102030405060708090a0b0c0d0e0f101112131415161718191a1b1c1d1e1f", "",
     "00112233445566778899aabbccddeeff", "8ea2b7ca516745bfeafc49904b496089"},
    {TEE_ALG_AES_ECB_NOPAD, kKey128, "", kPlain,
     "3ad77bb40d7a3660a89ecaf32466ef97f5d3d58503b9699de785895a96fdbaaf"
     "43b1cd7f598ece23881b00e3ed0306887b0c785e27e8ad3f8223207104725dd4"},
    {TEE_ALG_AES_ECB_NOPAD, kKey192, "", kPlain,
     "bd334f1d6e45f25ff712a214571fa5cc974104846d0ad3ad7734ecb3ecee4eef"
     "ef7afd2270e2e60adce0ba2face6444e9a4b41ba738d6c72fb16691603c18e0e"},
    {TEE_ALG_AES_ECB_NOPAD, kKey256, "", kPlain,
     "f3eed1bdb5d2a03c064b5a7e3db181f8591ccb10d410ed26dc5ba74a31362870"
     "b6ed21b99ca6f4f9f153e7b1beafed1d23304b7a39f9f3ff067d8d8f9e24ecc7"},
    {TEE_ALG_AES_CBC_NOPAD, kKey128, kCbcIv, kPlain,
     "7649abac8119b246cee98e9b12e9197d5086cb9b507219ee95db113a917678b2"
     "73bed6b8e3c1743b7116e69e222295163ff1caa1681fac09120eca307586e1a7"},
    {TEE_ALG_AES_CBC_NOPAD, kKey192, kCbcIv, kPlain,
     "4f021db243bc633d7178183a9fa071e8b4d9ada9ad7dedf4e5e738763f69145a"
     "571b242012fb7ae07fa9baac3df102e008b0e27988598881d920a9e64f5615cd"},
    {TEE_ALG_AES_CBC_NOPAD, kKey256, kCbcIv, kPlain,
     "f58c4c04d6e5f1ba779eabfb5f7bfbd69cfc4e967edb808d679f777bc6702c7d"
     "39f23369a9d9bacfa530e26304231461b2eb05e2c39be9fcda6c19078c6a9d1b"},
    {TEE_ALG_AES_CTR, kKey128, kCtrIv, kPlain,
     "874d6191b620e3261bef6864990db6ce9806f66b7970fdff8617187bb9fffdff"
     "5ae4df3edbd5d35e5b4f09020db03eab1e031dda2fbe03d1792170a0f3009cee"},
    {TEE_ALG_AES_CTR, kKey192, kCtrIv, kPlain,
     "1abc932417521ca24f2b0459fe7e6e0b090339ec0aa6faefd5ccc2c6f4ce8e94"
     "1e36b26bd1ebc670d1bd1d665620abf74f78a7f6d29809585a97daec58c6b050"},
    {TEE_ALG_AES_CTR, kKey256, kCtrIv, kPlain,
     "601ec313775789a5b7a7f504bbf3d228f443e3ca4d62b59aca84e990cacaf5c5"
     "2b0930daa23de94ce87017ba2d84988ddfc9c58db67aada613c2dd08457941a6"},
};
const CipherCase &kCbc128 = kCiphers[6];
const CipherCase &kCbc256 = kCiphers[8];
const CipherCase &kCtr128 = kCiphers[9];

// A keyed, initialized cipher operation.
struct Cipher {
    Op op;
    Cipher(uint32_t alg, uint32_t mode, const Bytes &key, const Bytes &iv) : op(alg, mode, 256) {
        Key k(TEE_TYPE_AES, key);
        EXPECT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        TEE_CipherInit(op, iv.data(), u32(iv.size()));
    }
};

// run_cipher - the input through updates of the given sizes and a final
// call with the rest, checking that each update releases exactly the
// whole blocks GP says (every byte in CTR).
Bytes run_cipher(TEE_OperationHandle op, const Bytes &in, const std::vector<size_t> &updates, bool stream) {
    Bytes out;
    size_t pos = 0, held = 0;
    for (size_t n : updates) {
        Bytes buf(n + 16);
        uint32_t len = u32(buf.size());
        EXPECT_EQ(TEE_CipherUpdate(op, in.data() + pos, u32(n), buf.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(len, stream ? n : (held + n) / 16 * 16) << "update of " << n << " after " << pos;
        held = stream ? 0 : (held + n) % 16;
        out.insert(out.end(), buf.begin(), buf.begin() + len);
        pos += n;
    }
    Bytes buf(in.size() - pos + 16);
    uint32_t len = u32(buf.size());
    EXPECT_EQ(TEE_CipherDoFinal(op, in.data() + pos, u32(in.size() - pos), buf.data(), &len), TEE_SUCCESS);
    out.insert(out.end(), buf.begin(), buf.begin() + len);
    return out;
}

TEST_F(Aes, CipherModesMatchTheKnownAnswersInBothDirectionsWhateverTheSplits) {
    std::mt19937 rng(197);
    for (const auto &c : kCiphers) {
        bool stream = c.alg == TEE_ALG_AES_CTR;
        Bytes plain = hex(c.plain), cipher = hex(c.cipher);
        std::vector<std::vector<size_t>> all = {
            {}, cycled({1}, plain.size()), cycled({7, 15, 17}, plain.size()), cycled({16, 3, 29}, plain.size())};
        for (int i = 0; i < 6; ++i) // the final call takes what the splits leave
            all.push_back(splits(rng, plain.size() - rng() % 17, 40));
        for (const auto &updates : all) {
            Cipher enc(c.alg, TEE_MODE_ENCRYPT, hex(c.key), hex(c.iv));
            EXPECT_EQ(to_hex(run_cipher(enc.op, plain, updates, stream)), c.cipher) << std::hex << c.alg;
            Cipher dec(c.alg, TEE_MODE_DECRYPT, hex(c.key), hex(c.iv));
            EXPECT_EQ(to_hex(run_cipher(dec.op, cipher, updates, stream)), c.plain) << std::hex << c.alg;
        }
    }
}

TEST_F(Aes, CipherWorksInPlaceWithOrWithoutAHeldBlock) {
    // Each update reads at its input offset and writes where the output so
    // far ends: the same address while no block is held, just behind it
    // otherwise.
    for (const CipherCase *c : {&kCiphers[3], &kCbc128, &kCtr128}) {
        for (uint32_t mode : {TEE_MODE_ENCRYPT, TEE_MODE_DECRYPT}) {
            for (std::vector<size_t> updates : {std::vector<size_t>{16, 32}, {5, 40}, {16, 7, 9, 20}}) {
                Cipher op(c->alg, mode, hex(c->key), hex(c->iv));
                Bytes buf = hex(mode == TEE_MODE_ENCRYPT ? c->plain : c->cipher);
                size_t in = 0, out = 0;
                for (size_t n : updates) {
                    uint32_t len = u32(buf.size() - out);
                    ASSERT_EQ(TEE_CipherUpdate(op.op, buf.data() + in, u32(n), buf.data() + out, &len), TEE_SUCCESS);
                    in += n;
                    out += len;
                }
                uint32_t len = u32(buf.size() - out);
                ASSERT_EQ(TEE_CipherDoFinal(op.op, buf.data() + in, u32(buf.size() - in), buf.data() + out, &len),
                          TEE_SUCCESS);
                EXPECT_EQ(to_hex(buf), mode == TEE_MODE_ENCRYPT ? c->cipher : c->plain)
                    << std::hex << c->alg << " mode " << mode << " first update " << std::dec << updates[0];
            }
        }
    }
}

TEST_F(Aes, CipherShortBufferReportsTheSizeAndConsumesNothing) {
    const CipherCase &c = kCbc128;
    Cipher enc(c.alg, TEE_MODE_ENCRYPT, hex(c.key), hex(c.iv));
    Bytes plain = hex(kPlain);
    Bytes out(64);
    uint32_t len = 15;
    EXPECT_EQ(TEE_CipherUpdate(enc.op, plain.data(), 20, out.data(), &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 16u);
    ASSERT_EQ(TEE_CipherUpdate(enc.op, plain.data(), 20, out.data(), &len), TEE_SUCCESS);
    ASSERT_EQ(len, 16u);
    len = 47;
    EXPECT_EQ(TEE_CipherDoFinal(enc.op, plain.data() + 20, 44, out.data() + 16, &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 48u);
    ASSERT_EQ(TEE_CipherDoFinal(enc.op, plain.data() + 20, 44, out.data() + 16, &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out), c.cipher);
}

TEST_F(Aes, NopadFinalOnAPartialBlockIsBadDataButCtrTakesAnyLength) {
    Bytes plain = hex(kPlain);
    Bytes out(80);
    for (uint32_t alg : {TEE_ALG_AES_ECB_NOPAD, TEE_ALG_AES_CBC_NOPAD}) {
        for (uint32_t mode : {TEE_MODE_ENCRYPT, TEE_MODE_DECRYPT}) {
            Cipher op(alg, mode, hex(kKey128), hex(kCbcIv));
            uint32_t len = 80;
            ASSERT_EQ(TEE_CipherUpdate(op.op, plain.data(), 10, out.data(), &len), TEE_SUCCESS);
            len = 80;
            EXPECT_EQ(TEE_CipherDoFinal(op.op, plain.data(), 5, out.data(), &len), TEE_ERROR_BAD_PARAMETERS);
            EXPECT_FALSE(op.op.handle_state() & TEE_HANDLE_FLAG_INITIALIZED) << "the computation is over";
        }
    }
    Cipher ctr(TEE_ALG_AES_CTR, TEE_MODE_ENCRYPT, hex(kKey128), hex(kCtrIv));
    uint32_t len = 80;
    ASSERT_EQ(TEE_CipherDoFinal(ctr.op, plain.data(), 23, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out.data(), len), std::string(kCtr128.cipher).substr(0, 46));
}

TEST_F(Aes, CipherCopyMidStreamAndReinitRestart) {
    const CipherCase &c = kCbc256;
    Bytes plain = hex(kPlain);
    Cipher a(c.alg, TEE_MODE_ENCRYPT, hex(c.key), hex(c.iv));
    Op b(c.alg, TEE_MODE_ENCRYPT, 256);
    Bytes head(32);
    uint32_t len = 32;
    ASSERT_EQ(TEE_CipherUpdate(a.op, plain.data(), 24, head.data(), &len), TEE_SUCCESS);
    TEE_CopyOperation(b, a.op);
    for (TEE_OperationHandle op : {a.op.h, b.h}) {
        Bytes tail(48);
        uint32_t n = 48;
        ASSERT_EQ(TEE_CipherDoFinal(op, plain.data() + 24, 40, tail.data(), &n), TEE_SUCCESS);
        Bytes all(head.begin(), head.begin() + 16);
        all.insert(all.end(), tail.begin(), tail.end());
        EXPECT_EQ(to_hex(all), c.cipher);
    }
    // A fresh Init starts over with the same key.
    Bytes iv = hex(c.iv);
    TEE_CipherInit(a.op, iv.data(), 16);
    EXPECT_EQ(to_hex(run_cipher(a.op, plain, {9}, false)), c.cipher);
}

TEST_F(Aes, CtrAgreesWithOpenSslAcrossTheCounterWrap) {
    std::mt19937 rng(3);
    for (const char *name : {"AES-128-CTR", "AES-192-CTR", "AES-256-CTR"}) {
        size_t key_len = name[4] == '1' ? (name[5] == '2' ? 16 : 24) : 32;
        Bytes key = random_bytes(rng, key_len), iv = random_bytes(rng, 16), msg = random_bytes(rng, 3000);
        // A counter about to wrap its low 64 bits.
        std::fill(iv.begin() + 8, iv.end(), 0xFF);
        Cipher enc(TEE_ALG_AES_CTR, TEE_MODE_ENCRYPT, key, iv);
        EXPECT_EQ(run_cipher(enc.op, msg, splits(rng, 2000, 300), true), ossl_cipher(name, key, iv, msg, true)) << name;
    }
}

// --- GCM --------------------------------------------------------------------------

struct GcmCase {
    const char *key;
    const char *nonce;
    const char *aad;
    const char *plain;
    const char *cipher;
    const char *tag;
};

const char *kTcKey = "feffe9928665731c6d6a8f9467308308";
const char *kTcNonce = "cafebabefacedbaddecaf888";
const char *kTcAad = "feedfacedeadbeeffeedfacedeadbeefabaddad2";
const char *kTcPlain64 = "d9313225f88406e5a55909c5aff5269a86a7a9531534f7da2e4c303d8a318a72"
                         "1c3c0c95956809532fcf0e2449a6b525b16aedf5aa0de657ba637b391aafd255";
const char *kTcPlain60 = "d9313225f88406e5a55909c5aff5269a86a7a9531534f7da2e4c303d8a318a72"
                         "1c3c0c95956809532fcf0e2449a6b525b16aedf5aa0de657ba637b39";
const char *kZero96 = "000000000000000000000000";

// The GCM submission's test cases: 1 to 4, 7, 8, 10 and 13 to 16 with
// 96-bit nonces, with and without AAD, for the three key sizes; 5 and 6
// with 64- and 480-bit nonces, which GP's interface also takes.
const GcmCase kGcm[] = {
    {"00000000000000000000000000000000", kZero96, "", "", "", "58e2fccefa7e3061367f1d57a4e7455a"},
    {"00000000000000000000000000000000", kZero96, "", "00000000000000000000000000000000",
     "0388dace60b6a392f328c2b971b2fe78", "ab6e47d42cec13bdf53a67b21257bddf"},
    {kTcKey, kTcNonce, "", kTcPlain64,
     "42831ec2217774244b7221b784d0d49ce3aa212f2c02a4e035c17e2329aca12e"
     "21d514b25466931c7d8f6a5aac84aa051ba30b396a0aac973d58e091473f5985",
     "4d5c2af327cd64a62cf35abd2ba6fab4"},
    {kTcKey, kTcNonce, kTcAad, kTcPlain60,
     "42831ec2217774244b7221b784d0d49ce3aa212f2c02a4e035c17e2329aca12e"
     "21d514b25466931c7d8f6a5aac84aa051ba30b396a0aac973d58e091",
     "5bc94fbc3221a5db94fae95ae7121a47"},
    {"000000000000000000000000000000000000000000000000", kZero96, "", "", "", "cd33b28ac773f74ba00ed1f312572435"},
    {"000000000000000000000000000000000000000000000000", kZero96, "", "00000000000000000000000000000000",
     "98e7247c07f0fe411c267e4384b0f600", "2ff58d80033927ab8ef4d4587514f0fb"},
    {"feffe9928665731c6d6a8f9467308308feffe9928665731c", kTcNonce, kTcAad, kTcPlain60,
     "3980ca0b3c00e841eb06fac4872a2757859e1ceaa6efd984628593b40ca1e19c"
     "7d773d00c144c525ac619d18c84a3f4718e2448b2fe324d9ccda2710",
     "2519498e80f1478f37ba55bd6d27618c"},
    {"0000000000000000000000000000000000000000000000000000000000000000", kZero96, "", "", "",
     "530f8afbc74536b9a963b4f1c4cb738b"},
    {"0000000000000000000000000000000000000000000000000000000000000000", kZero96, "",
     "00000000000000000000000000000000", "cea7403d4d606b6e074ec5d3baf39d18", "d0d1c8a799996bf0265b98b5d48ab919"},
    {"feffe9928665731c6d6a8f9467308308feffe9928665731c6d6a8f9467308308", kTcNonce, "", kTcPlain64,
     "522dc1f099567d07f47f37a32a84427d643a8cdcbfe5c0c97598a2bd2555d1aa"
     "8cb08e48590dbb3da7b08b1056828838c5f61e6393ba7a0abcc9f662898015ad",
     "b094dac5d93471bdec1a502270e3cc6c"},
    {"feffe9928665731c6d6a8f9467308308feffe9928665731c6d6a8f9467308308", kTcNonce, kTcAad, kTcPlain60,
     "522dc1f099567d07f47f37a32a84427d643a8cdcbfe5c0c97598a2bd2555d1aa"
     "8cb08e48590dbb3da7b08b1056828838c5f61e6393ba7a0abcc9f662",
     "76fc6ece0f4e1768cddf8853bb2d551b"},
    {kTcKey, "cafebabefacedbad", kTcAad, kTcPlain60,
     "61353b4c2806934a777ff51fa22a4755699b2a714fcdc6f83766e5f97b6c7423"
     "73806900e49f24b22b097544d4896b424989b5e1ebac0f07c23f4598",
     "3612d2e79e3b0785561be14aaca2fccb"},
    {kTcKey,
     "9313225df88406e555909c5aff5269aa6a7a9538534f7da1e4c303d2a318a728"
     "c3c0c95156809539fcf0e2429a6b525416aedbf5a0de6a57a637b39b",
     kTcAad, kTcPlain60,
     "8ce24998625615b603a033aca13fb894be9112a5c3a211a8ba262a3cca7e2ca7"
     "01e4a9a4fba43c90ccdcb281d48c7c6fd62875d2aca417034c34aee5",
     "619cc5aefffe0bfa462af43c1699d050"},
};
const GcmCase &kTc4 = kGcm[3];

const uint32_t kTagBits[] = {96, 104, 112, 120, 128};

struct Gcm {
    Op op;
    Gcm(uint32_t mode, const Bytes &key, const Bytes &nonce, uint32_t tag_bits) : op(TEE_ALG_AES_GCM, mode, 256) {
        Key k(TEE_TYPE_AES, key);
        EXPECT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), u32(nonce.size()), tag_bits, 0, 0), TEE_SUCCESS);
    }
};

// gcm_run - one AE computation: the AAD in pieces of the given sizes, the
// payload in updates of the given sizes and the rest in the final call.
// Encryption gives ciphertext and tag; decryption checks `tag` and gives
// the plaintext, its output starting as 0xEE so that any release shows.
struct GcmRun {
    std::vector<size_t> aad_pieces;
    std::vector<size_t> updates;
};

TEE_Result gcm_run(uint32_t mode, const GcmCase &c, const Bytes &aad, const Bytes &in, uint32_t tag_bits,
                   const GcmRun &how, Bytes *out, Bytes *tag) {
    Gcm g(mode, hex(c.key), hex(c.nonce), tag_bits);
    size_t pos = 0;
    for (size_t n : how.aad_pieces) {
        TEE_AEUpdateAAD(g.op, aad.data() + pos, u32(n));
        pos += n;
    }
    TEE_AEUpdateAAD(g.op, aad.data() + pos, u32(aad.size() - pos));
    out->assign(in.size(), 0xEE);
    pos = 0;
    for (size_t n : how.updates) {
        uint32_t len = u32(n);
        EXPECT_EQ(TEE_AEUpdate(g.op, in.data() + pos, u32(n), out->data() + pos, &len), TEE_SUCCESS);
        EXPECT_EQ(len, n) << "GCM releases what it takes";
        pos += n;
    }
    uint32_t len = u32(in.size() - pos);
    if (mode == TEE_MODE_DECRYPT) {
        TEE_Result res =
            TEE_AEDecryptFinal(g.op, in.data() + pos, len, out->data() + pos, &len, tag->data(), u32(tag->size()));
        EXPECT_EQ(len, res == TEE_SUCCESS ? in.size() - pos : 0u);
        return res;
    }
    tag->assign(16, 0);
    uint32_t tag_len = 16;
    TEE_Result res = TEE_AEEncryptFinal(g.op, in.data() + pos, len, out->data() + pos, &len, tag->data(), &tag_len);
    EXPECT_EQ(tag_len, tag_bits / 8);
    tag->resize(tag_len);
    return res;
}

TEST_F(Aes, GcmMatchesTheTestCasesForEveryTagLength) {
    for (const auto &c : kGcm) {
        Bytes aad = hex(c.aad), plain = hex(c.plain), cipher = hex(c.cipher);
        for (uint32_t bits : kTagBits) {
            Bytes out, tag;
            ASSERT_EQ(gcm_run(TEE_MODE_ENCRYPT, c, aad, plain, bits, {}, &out, &tag), TEE_SUCCESS);
            EXPECT_EQ(to_hex(out), c.cipher) << c.key << " " << c.nonce;
            // A shorter tag is the leading part of the full one.
            EXPECT_EQ(to_hex(tag), std::string(c.tag).substr(0, bits / 4)) << c.key << " " << c.nonce;

            ASSERT_EQ(gcm_run(TEE_MODE_DECRYPT, c, aad, cipher, bits, {}, &out, &tag), TEE_SUCCESS);
            EXPECT_EQ(to_hex(out), c.plain);
        }
    }
}

TEST_F(Aes, GcmGivesTheSameResultWhateverTheSplits) {
    std::mt19937 rng(38);
    const GcmCase &c = kTc4;
    Bytes aad = hex(c.aad), plain = hex(c.plain), cipher = hex(c.cipher), tag = hex(c.tag);
    for (int round = 0; round < 24; ++round) {
        GcmRun how{splits(rng, rng() % (aad.size() + 1), 9), splits(rng, rng() % (plain.size() + 1), 23)};
        Bytes out, got_tag;
        ASSERT_EQ(gcm_run(TEE_MODE_ENCRYPT, c, aad, plain, 128, how, &out, &got_tag), TEE_SUCCESS);
        EXPECT_EQ(to_hex(out), c.cipher) << "round " << round;
        EXPECT_EQ(got_tag, tag) << "round " << round;
        ASSERT_EQ(gcm_run(TEE_MODE_DECRYPT, c, aad, cipher, 128, how, &out, &tag), TEE_SUCCESS) << "round " << round;
        EXPECT_EQ(to_hex(out), c.plain);
    }
}

TEST_F(Aes, GcmDecryptFinalReleasesNothingWhenAnythingWasAltered) {
    const GcmCase &c = kTc4;
    Bytes cipher = hex(c.cipher), aad = hex(c.aad);
    GcmRun how{{7}, {16}}; // the first 16 bytes go out before the tag is seen
    auto altered = [](Bytes b, size_t i) {
        b[i] ^= 0x80;
        return b;
    };
    for (uint32_t bits : kTagBits) {
        Bytes tag = hex(c.tag);
        tag.resize(bits / 8);
        auto refused = [&](const char *what, const Bytes &ci, Bytes t, const Bytes &a) {
            Bytes out;
            EXPECT_EQ(gcm_run(TEE_MODE_DECRYPT, c, a, ci, bits, how, &out, &t), TEE_ERROR_MAC_INVALID)
                << what << " " << bits;
            EXPECT_EQ(Bytes(out.begin() + 16, out.end()), Bytes(out.size() - 16, 0xEE))
                << what << ": the final call released plaintext";
        };
        refused("tag", cipher, altered(tag, tag.size() - 1), aad);
        refused("first tag byte", cipher, altered(tag, 0), aad);
        refused("early ciphertext", altered(cipher, 3), tag, aad);
        refused("final ciphertext", altered(cipher, 40), tag, aad);
        refused("aad", cipher, tag, altered(aad, 19));
        refused("tag shorter than announced", cipher, Bytes(tag.begin(), tag.end() - 1), aad);
        Bytes longer = tag;
        longer.push_back(0);
        refused("tag longer than announced", cipher, longer, aad);
    }
}

TEST_F(Aes, GcmTakesOnlyGpTagLengthsAndReportsShortBuffers) {
    Bytes key = hex(kTcKey), nonce = hex(kTcNonce);
    Key k(TEE_TYPE_AES, key);
    Op op(TEE_ALG_AES_GCM, TEE_MODE_ENCRYPT, 128, k);
    for (uint32_t bits : {0u, 8u, 32u, 64u, 88u, 100u, 127u, 136u, 256u})
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), 12, bits, 0, 0), TEE_ERROR_NOT_SUPPORTED) << bits;
    EXPECT_EQ(TEE_AEInit(op, nonce.data(), 0, 128, 0, 0), TEE_ERROR_NOT_SUPPORTED) << "an empty nonce";
    for (uint32_t bits : kTagBits) {
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), 12, bits, 0, 0), TEE_SUCCESS) << bits;
        EXPECT_EQ(op.info().digestLength, bits / 8);
    }

    Bytes aad = hex(kTcAad), plain = hex(kTcPlain60), out(plain.size()), tag(16);
    TEE_AEUpdateAAD(op, aad.data(), u32(aad.size()));
    uint32_t len = 9;
    EXPECT_EQ(TEE_AEUpdate(op, plain.data(), 10, out.data(), &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 10u);
    ASSERT_EQ(TEE_AEUpdate(op, plain.data(), 10, out.data(), &len), TEE_SUCCESS);
    uint32_t rest = u32(plain.size() - 10);
    len = rest;
    uint32_t tag_len = 15;
    EXPECT_EQ(TEE_AEEncryptFinal(op, plain.data() + 10, rest, out.data() + 10, &len, tag.data(), &tag_len),
              TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(tag_len, 16u);
    len = rest - 1;
    EXPECT_EQ(TEE_AEEncryptFinal(op, plain.data() + 10, rest, out.data() + 10, &len, tag.data(), &tag_len),
              TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, rest);
    ASSERT_EQ(TEE_AEEncryptFinal(op, plain.data() + 10, rest, out.data() + 10, &len, tag.data(), &tag_len),
              TEE_SUCCESS);
    EXPECT_EQ(to_hex(out), kTc4.cipher);
    EXPECT_EQ(to_hex(tag), kTc4.tag);

    // A short buffer at the final decryption consumes nothing either.
    Gcm dec(TEE_MODE_DECRYPT, key, nonce, 128);
    TEE_AEUpdateAAD(dec.op, aad.data(), u32(aad.size()));
    Bytes cipher = hex(kTc4.cipher), back(cipher.size());
    len = u32(cipher.size() - 1);
    EXPECT_EQ(TEE_AEDecryptFinal(dec.op, cipher.data(), u32(cipher.size()), back.data(), &len, tag.data(), 16),
              TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, cipher.size());
    ASSERT_EQ(TEE_AEDecryptFinal(dec.op, cipher.data(), u32(cipher.size()), back.data(), &len, tag.data(), 16),
              TEE_SUCCESS);
    EXPECT_EQ(to_hex(back), kTcPlain60);
}

// ossl_gcm - encryption by OpenSSL in one call, with a 16-byte tag.
void ossl_gcm(const Bytes &key, const Bytes &nonce, const Bytes &aad, const Bytes &msg, Bytes *out, Bytes *tag) {
    const char *names[] = {"AES-128-GCM", "AES-192-GCM", "AES-256-GCM"};
    EVP_CIPHER *cipher = EVP_CIPHER_fetch(nullptr, names[(key.size() - 16) / 8], nullptr);
    EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
    size_t iv_len = nonce.size();
    OSSL_PARAM iv_params[] = {OSSL_PARAM_construct_size_t(OSSL_CIPHER_PARAM_AEAD_IVLEN, &iv_len),
                              OSSL_PARAM_construct_end()};
    ASSERT_EQ(EVP_EncryptInit_ex2(ctx, cipher, nullptr, nullptr, iv_params), 1);
    ASSERT_EQ(EVP_EncryptInit_ex2(ctx, nullptr, key.data(), nonce.data(), nullptr), 1);
    int n = 0;
    out->assign(msg.size() + 16, 0);
    tag->assign(16, 0);
    ASSERT_EQ(EVP_EncryptUpdate(ctx, nullptr, &n, aad.data(), static_cast<int>(aad.size())), 1);
    ASSERT_EQ(EVP_EncryptUpdate(ctx, out->data(), &n, msg.data(), static_cast<int>(msg.size())), 1);
    out->resize(static_cast<size_t>(n));
    ASSERT_EQ(EVP_EncryptFinal_ex(ctx, tag->data(), &n), 1);
    OSSL_PARAM tag_params[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, tag->data(), 16),
                               OSSL_PARAM_construct_end()};
    ASSERT_EQ(EVP_CIPHER_CTX_get_params(ctx, tag_params), 1);
    EVP_CIPHER_CTX_free(ctx);
    EVP_CIPHER_free(cipher);
}

TEST_F(Aes, GcmAgreesWithOpenSslForRandomInputs) {
    std::mt19937 rng(5);
    for (int round = 0; round < 6; ++round) {
        Bytes key = random_bytes(rng, 16 + 8 * (round % 3)), nonce = random_bytes(rng, 1 + rng() % 40);
        Bytes aad = random_bytes(rng, rng() % 70), msg = random_bytes(rng, rng() % 300);
        Gcm g(TEE_MODE_ENCRYPT, key, nonce, 128);
        TEE_AEUpdateAAD(g.op, aad.data(), u32(aad.size()));
        Bytes out(msg.size()), tag(16);
        uint32_t len = u32(out.size()), tag_len = 16;
        ASSERT_EQ(TEE_AEEncryptFinal(g.op, msg.data(), u32(msg.size()), out.data(), &len, tag.data(), &tag_len),
                  TEE_SUCCESS);
        Bytes want, want_tag;
        ossl_gcm(key, nonce, aad, msg, &want, &want_tag);
        EXPECT_EQ(out, want);
        EXPECT_EQ(tag, want_tag);
    }
}

TEST_F(Aes, AMebibyteOfGcmThroughLargeUpdatesInPlace) {
    std::mt19937 rng(64);
    Bytes key = random_bytes(rng, 32), nonce = random_bytes(rng, 12), aad = random_bytes(rng, 33);
    Bytes msg = random_bytes(rng, size_t{1} << 20), want, want_tag;
    ossl_gcm(key, nonce, aad, msg, &want, &want_tag);
    constexpr size_t kUpdate = 64 * 1024;
    for (uint32_t mode : {TEE_MODE_ENCRYPT, TEE_MODE_DECRYPT}) {
        Bytes buf = mode == TEE_MODE_ENCRYPT ? msg : want, tag = want_tag;
        Gcm g(mode, key, nonce, 128);
        TEE_AEUpdateAAD(g.op, aad.data(), u32(aad.size()));
        size_t pos = 0;
        for (; buf.size() - pos > kUpdate; pos += kUpdate) {
            uint32_t len = kUpdate;
            ASSERT_EQ(TEE_AEUpdate(g.op, buf.data() + pos, kUpdate, buf.data() + pos, &len), TEE_SUCCESS);
        }
        uint32_t len = u32(buf.size() - pos), tag_len = 16;
        if (mode == TEE_MODE_ENCRYPT) {
            ASSERT_EQ(TEE_AEEncryptFinal(g.op, buf.data() + pos, len, buf.data() + pos, &len, tag.data(), &tag_len),
                      TEE_SUCCESS);
            EXPECT_EQ(tag, want_tag);
            EXPECT_TRUE(buf == want);
        } else {
            ASSERT_EQ(TEE_AEDecryptFinal(g.op, buf.data() + pos, len, buf.data() + pos, &len, tag.data(), 16),
                      TEE_SUCCESS);
            EXPECT_TRUE(buf == msg);
        }
    }
}

// --- Misuse --------------------------------------------------------------------------

TEST_F(AesDeathTest, CipherMisusePanics) {
    Key aes(TEE_TYPE_AES, Bytes(16, 1)), aes256(TEE_TYPE_AES, Bytes(32, 1));
    Key hmac(TEE_TYPE_HMAC_SHA256, Bytes(32, 1));
    uint8_t buf[64] = {};
    uint32_t len = sizeof buf;

    Op cbc(TEE_ALG_AES_CBC_NOPAD, TEE_MODE_ENCRYPT, 128);
    EXPECT_DEATH(TEE_CipherInit(cbc, buf, 16), "before its key was set");
    EXPECT_DEATH(TEE_SetOperationKey(cbc, aes256), "larger than the operation's maximum");
    EXPECT_DEATH(TEE_SetOperationKey(cbc, hmac), "wrong type");
    ASSERT_EQ(TEE_SetOperationKey(cbc, aes), TEE_SUCCESS);
    EXPECT_DEATH(TEE_CipherUpdate(cbc, buf, 16, buf, &len), "before it was initialized");
    EXPECT_DEATH(TEE_CipherDoFinal(cbc, buf, 16, buf, &len), "before it was initialized");
    EXPECT_DEATH(TEE_CipherInit(cbc, buf, 8), "16-byte IV");
    EXPECT_DEATH(TEE_CipherInit(cbc, nullptr, 16), "16-byte IV");
    TEE_CipherInit(cbc, buf, 16);
    EXPECT_DEATH(TEE_SetOperationKey(cbc, aes), "active operation");
    EXPECT_DEATH(TEE_CipherUpdate(cbc, buf, 16, buf, nullptr), "null output length");
    EXPECT_DEATH(TEE_CipherUpdate(cbc, nullptr, 16, buf, &len), "null input buffer");
    EXPECT_DEATH(TEE_AEUpdateAAD(cbc, buf, 4), "wrong class");

    Op ctr(TEE_ALG_AES_CTR, TEE_MODE_DECRYPT, 256, aes);
    EXPECT_DEATH(TEE_CipherInit(ctr, nullptr, 0), "16-byte IV");
}

TEST_F(AesDeathTest, AeMisusePanics) {
    Key aes(TEE_TYPE_AES, Bytes(16, 1)), aes256(TEE_TYPE_AES, Bytes(32, 1));
    uint8_t buf[64] = {};
    uint32_t len = sizeof buf, tag_len = 16;

    Op enc(TEE_ALG_AES_GCM, TEE_MODE_ENCRYPT, 128);
    EXPECT_DEATH(TEE_AEInit(enc, buf, 12, 128, 0, 0), "before its key was set");
    EXPECT_DEATH(TEE_SetOperationKey(enc, aes256), "larger than the operation's maximum");
    ASSERT_EQ(TEE_SetOperationKey(enc, aes), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEUpdateAAD(enc, buf, 4), "before it was initialized");
    EXPECT_DEATH(TEE_AEUpdate(enc, buf, 16, buf, &len), "before it was initialized");
    EXPECT_DEATH(TEE_AEEncryptFinal(enc, buf, 16, buf, &len, buf, &tag_len), "before it was initialized");
    EXPECT_DEATH(TEE_AEInit(enc, nullptr, 12, 128, 0, 0), "null nonce");
    ASSERT_EQ(TEE_AEInit(enc, buf, 12, 128, 0, 0), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEDecryptFinal(enc, buf, 0, buf, &len, buf, 16), "wrong mode");
    ASSERT_EQ(TEE_AEUpdate(enc, buf, 16, buf, &len), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEUpdateAAD(enc, buf, 4), "after payload");
    EXPECT_DEATH(TEE_AEEncryptFinal(enc, buf, 0, buf, &len, nullptr, &tag_len), "null buffer");

    Op dec(TEE_ALG_AES_GCM, TEE_MODE_DECRYPT, 128, aes);
    ASSERT_EQ(TEE_AEInit(dec, buf, 12, 128, 0, 0), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEEncryptFinal(dec, buf, 0, buf, &len, buf, &tag_len), "wrong mode");
    len = sizeof buf;
    ASSERT_EQ(TEE_AEUpdate(dec, buf, 16, buf, &len), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEUpdateAAD(dec, buf, 4), "after payload");
}

} // namespace
