/*
 * The platform's crypto operations: digests, HMAC, AES ECB/CBC/CTR and
 * AES-GCM against the standards' known answers and against OpenSSL called
 * directly, the GP output-size and state rules, and the panics on misuse.
 */
#include <cstring>
#include <random>

#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>

#include "ta_fixture.h"

namespace {

class Crypto : public TeeTest {};

// Handles freed at scope exit, so that a failed assertion leaks nothing.
struct Op {
    TEE_OperationHandle h = TEE_HANDLE_NULL;
    Op() = default;
    Op(uint32_t alg, uint32_t mode, uint32_t max_bits) {
        EXPECT_EQ(TEE_AllocateOperation(&h, alg, mode, max_bits), TEE_SUCCESS) << std::hex << alg;
    }
    ~Op() { TEE_FreeOperation(h); }
    Op(const Op &) = delete;
    Op &operator=(const Op &) = delete;
    operator TEE_OperationHandle() const { return h; }
};

struct Key {
    TEE_ObjectHandle h = TEE_HANDLE_NULL;
    Key(uint32_t type, const Bytes &secret, uint32_t max_bits = 0) {
        uint32_t bits = max_bits ? max_bits : static_cast<uint32_t>(secret.size() * 8);
        EXPECT_EQ(TEE_AllocateTransientObject(type, bits, &h), TEE_SUCCESS);
        TEE_Attribute a{};
        TEE_InitRefAttribute(&a, TEE_ATTR_SECRET_VALUE, secret.data(), static_cast<uint32_t>(secret.size()));
        EXPECT_EQ(TEE_PopulateTransientObject(h, &a, 1), TEE_SUCCESS);
    }
    ~Key() { TEE_FreeTransientObject(h); }
    Key(const Key &) = delete;
    Key &operator=(const Key &) = delete;
    operator TEE_ObjectHandle() const { return h; }
};

Bytes text(const char *s) { return Bytes(s, s + std::strlen(s)); }

Bytes random_bytes(std::mt19937 &rng, size_t n) {
    Bytes b(n);
    for (auto &x : b)
        x = static_cast<uint8_t>(rng());
    return b;
}

uint32_t u32(size_t n) { return static_cast<uint32_t>(n); }

uint32_t handle_state(TEE_OperationHandle op) {
    TEE_OperationInfo info{};
    TEE_GetOperationInfo(op, &info);
    return info.handleState;
}

// --- Digests -------------------------------------------------------------------

struct DigestCase {
    uint32_t alg;
    const char *abc; // FIPS 180 / RFC 1321 digest of "abc"
};

const DigestCase kDigests[] = {
    {TEE_ALG_MD5, "900150983cd24fb0d6963f7d28e17f72"},
    {TEE_ALG_SHA1, "a9993e364706816aba3e25717850c26c9cd0d89d"},
    {TEE_ALG_SHA224, "23097d223405d8228642a477bda255b32aadbce4bda0b3f7e36c9da7"},
    {TEE_ALG_SHA256, "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
    {TEE_ALG_SHA384, "cb00753f45a35e8bb5a03d699ac65007272c32ab0eded1631a8b605a43ff5bed8086072ba1e7cc2358baeca134c825a7"},
    {TEE_ALG_SHA512, "ddaf35a193617abacc417349ae20413112e6fa4e89a97ea20a9eeee64b55d39a"
                     "2192992a274fc1a836ba3c23a3feebbd454d4423643ce80e2a9ac94fa54ca49f"},
};

TEST_F(Crypto, DigestsMatchTheAbcVectorsAndAreReusableAfterFinal) {
    for (const auto &c : kDigests) {
        Op op(c.alg, TEE_MODE_DIGEST, 0);
        Bytes want = hex(c.abc);
        TEE_OperationInfo info{};
        TEE_GetOperationInfo(op, &info);
        EXPECT_EQ(info.digestLength, want.size());
        EXPECT_EQ(info.operationClass, TEE_OPERATION_DIGEST);

        TEE_DigestUpdate(op, "a", 1);
        Bytes out(64);
        uint32_t len = u32(out.size());
        ASSERT_EQ(TEE_DigestDoFinal(op, "bc", 2, out.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(to_hex(out.data(), len), c.abc);

        // The final call starts a fresh digest.
        len = u32(out.size());
        ASSERT_EQ(TEE_DigestDoFinal(op, "abc", 3, out.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(to_hex(out.data(), len), c.abc);
    }
}

TEST_F(Crypto, DigestShortBufferConsumesNothing) {
    Op op(TEE_ALG_SHA256, TEE_MODE_DIGEST, 0);
    TEE_DigestUpdate(op, "ab", 2);
    Bytes out(32);
    uint32_t len = 31;
    EXPECT_EQ(TEE_DigestDoFinal(op, "c", 1, out.data(), &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 32u);
    ASSERT_EQ(TEE_DigestDoFinal(op, "c", 1, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out), kDigests[3].abc);
}

TEST_F(Crypto, DigestCopyAndResetKeepTheRightState) {
    const char *msg = "abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq";
    const char *want = "248d6a61d20638b8e5c026930c3e6039a33ce45964ff2167f6ecedd419db06c1";
    Op a(TEE_ALG_SHA256, TEE_MODE_DIGEST, 0);
    Op b(TEE_ALG_SHA256, TEE_MODE_DIGEST, 0);
    TEE_DigestUpdate(a, msg, 20);
    TEE_CopyOperation(b, a);
    Bytes out(32);
    for (TEE_OperationHandle op : {a.h, b.h}) {
        uint32_t len = 32;
        ASSERT_EQ(TEE_DigestDoFinal(op, msg + 20, u32(std::strlen(msg) - 20), out.data(), &len), TEE_SUCCESS);
        EXPECT_EQ(to_hex(out), want);
    }
    TEE_DigestUpdate(a, "junk", 4);
    TEE_ResetOperation(a);
    uint32_t len = 32;
    ASSERT_EQ(TEE_DigestDoFinal(a, msg, u32(std::strlen(msg)), out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out), want);
}

TEST_F(Crypto, DigestsAgreeWithOpenSslOverRandomChunking) {
    std::mt19937 rng(7);
    const char *names[] = {"MD5", "SHA1", "SHA224", "SHA256", "SHA384", "SHA512"};
    for (int i = 0; i < 6; ++i) {
        Bytes msg = random_bytes(rng, 1000 + rng() % 3000);
        Op op(kDigests[i].alg, TEE_MODE_DIGEST, 0);
        size_t pos = 0;
        while (msg.size() - pos > 200) {
            size_t n = rng() % 200;
            TEE_DigestUpdate(op, msg.data() + pos, u32(n));
            pos += n;
        }
        Bytes out(64);
        uint32_t len = 64;
        ASSERT_EQ(TEE_DigestDoFinal(op, msg.data() + pos, u32(msg.size() - pos), out.data(), &len), TEE_SUCCESS);
        Bytes want(EVP_MAX_MD_SIZE);
        unsigned int want_len = 0;
        EVP_MD *md = EVP_MD_fetch(nullptr, names[i], nullptr);
        ASSERT_EQ(EVP_Digest(msg.data(), msg.size(), want.data(), &want_len, md, nullptr), 1);
        EVP_MD_free(md);
        want.resize(want_len);
        out.resize(len);
        EXPECT_EQ(out, want) << names[i];
    }
}

// --- HMAC ------------------------------------------------------------------------

struct MacCase {
    uint32_t alg;
    Bytes key;
    Bytes msg;
    const char *mac;
};

std::vector<MacCase> mac_vectors() {
    Bytes k16(16, 0x0b), k20(20, 0x0b), jefe = text("Jefe"), k131(131, 0xaa);
    Bytes hi = text("Hi There"), what = text("what do ya want for nothing?");
    Bytes big = text("Test Using Larger Than Block-Size Key - Hash Key First");
    return {
        // RFC 2202
        {TEE_ALG_HMAC_MD5, k16, hi, "9294727a3638bb1c13f48ef8158bfc9d"},
        {TEE_ALG_HMAC_MD5, jefe, what, "750c783e6ab0b503eaa86e310a5db738"},
        {TEE_ALG_HMAC_SHA1, k20, hi, "b617318655057264e28bc0b6fb378c8ef146be00"},
        {TEE_ALG_HMAC_SHA1, jefe, what, "effcdf6ae5eb2fa2d27416d5f184df9c259a7c79"},
        // RFC 4231 cases 1, 2 and 6
        {TEE_ALG_HMAC_SHA224, k20, hi, "896fb1128abbdf196832107cd49df33f47b4b1169912ba4f53684b22"},
        {TEE_ALG_HMAC_SHA224, jefe, what, "a30e01098bc6dbbf45690f3a7e9e6d0f8bbea2a39e6148008fd05e44"},
        {TEE_ALG_HMAC_SHA224, k131, big, "95e9a0db962095adaebe9b2d6f0dbce2d499f112f2d2b7273fa6870e"},
        {TEE_ALG_HMAC_SHA256, k20, hi, "b0344c61d8db38535ca8afceaf0bf12b881dc200c9833da726e9376c2e32cff7"},
        {TEE_ALG_HMAC_SHA256, jefe, what, "5bdcc146bf60754e6a042426089575c75a003f089d2739839dec58b964ec3843"},
        {TEE_ALG_HMAC_SHA256, k131, big, "60e431591ee0b67f0d8a26aacbf5b77f8e0bc6213728c5140546040f0ee37f54"},
        {TEE_ALG_HMAC_SHA384, k20, hi,
         "afd03944d84895626b0825f4ab46907f15f9dadbe4101ec682aa034c7cebc59cfaea9ea9076ede7f4af152e8b2fa9cb6"},
        {TEE_ALG_HMAC_SHA384, jefe, what,
         "af45d2e376484031617f78d2b58a6b1b9c7ef464f5a01b47e42ec3736322445e8e2240ca5e69e2c78b3239ecfab21649"},
        {TEE_ALG_HMAC_SHA384, k131, big,
         "4ece084485813e9088d2c63a041bc5b44f9ef1012a2b588f3cd11f05033ac4c60c2ef6ab4030fe8296248df163f44952"},
        {TEE_ALG_HMAC_SHA512, k20, hi,
         "87aa7cdea5ef619d4ff0b4241a1d6cb02379f4e2ce4ec2787ad0b30545e17cde"
         "daa833b7d6b8a702038b274eaea3f4e4be9d914eeb61f1702e696c203a126854"},
        {TEE_ALG_HMAC_SHA512, jefe, what,
         "164b7a7bfcf819e2e395fbe73b56e0a387bd64222e831fd610270cd7ea250554"
         "9758bf75c05a994a6d034f65f8f0e6fdcaeab1a34d4a6b4b636e070a38bce737"},
        {TEE_ALG_HMAC_SHA512, k131, big,
         "80b24263c7c1a3ebb71493c1dd7be8b49b46d1f41b4aeec1121b013783f8f352"
         "6b56d037e05f2598bd0fd2215d6a1e5295e64f73f63f0aec8b915a985d786598"},
    };
}

// A generic secret keys any HMAC, whatever its length.
Bytes compute_mac(uint32_t alg, const Bytes &key, const Bytes &msg, size_t chunk) {
    Op op(alg, TEE_MODE_MAC, 4096);
    Key k(TEE_TYPE_GENERIC_SECRET, key);
    EXPECT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
    TEE_MACInit(op, nullptr, 0);
    size_t pos = 0;
    for (; chunk && pos + chunk < msg.size(); pos += chunk)
        TEE_MACUpdate(op, msg.data() + pos, u32(chunk));
    Bytes out(64);
    uint32_t len = 64;
    EXPECT_EQ(TEE_MACComputeFinal(op, msg.data() + pos, u32(msg.size() - pos), out.data(), &len), TEE_SUCCESS);
    out.resize(len);
    return out;
}

TEST_F(Crypto, HmacMatchesRfcVectorsOneShotAndByteByByte) {
    for (const auto &c : mac_vectors()) {
        EXPECT_EQ(to_hex(compute_mac(c.alg, c.key, c.msg, 0)), c.mac) << std::hex << c.alg;
        EXPECT_EQ(to_hex(compute_mac(c.alg, c.key, c.msg, 1)), c.mac) << std::hex << c.alg;
    }
}

TEST_F(Crypto, MacCompareFinalAcceptsOnlyTheExactMac) {
    for (const auto &c : mac_vectors()) {
        Op op(c.alg, TEE_MODE_MAC, 4096);
        Key k(TEE_TYPE_GENERIC_SECRET, c.key);
        ASSERT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        Bytes mac = hex(c.mac);
        auto compare = [&](const Bytes &m) {
            TEE_MACInit(op, nullptr, 0);
            TEE_MACUpdate(op, c.msg.data(), 3);
            return TEE_MACCompareFinal(op, c.msg.data() + 3, u32(c.msg.size() - 3), m.data(), u32(m.size()));
        };
        EXPECT_EQ(compare(mac), TEE_SUCCESS);
        Bytes flipped = mac;
        flipped.back() ^= 0x01;
        EXPECT_EQ(compare(flipped), TEE_ERROR_MAC_INVALID);
        EXPECT_EQ(compare(Bytes(mac.begin(), mac.end() - 1)), TEE_ERROR_MAC_INVALID);
        Bytes longer = mac;
        longer.push_back(0);
        EXPECT_EQ(compare(longer), TEE_ERROR_MAC_INVALID);
    }
}

TEST_F(Crypto, MacShortBufferKeepsTheComputationGoing) {
    const MacCase c = mac_vectors()[8];
    Op op(c.alg, TEE_MODE_MAC, 1024);
    Key k(TEE_TYPE_GENERIC_SECRET, c.key);
    ASSERT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
    TEE_MACInit(op, nullptr, 0);
    TEE_MACUpdate(op, c.msg.data(), 10);
    Bytes out(32);
    uint32_t len = 16;
    EXPECT_EQ(TEE_MACComputeFinal(op, c.msg.data() + 10, u32(c.msg.size() - 10), out.data(), &len),
              TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(len, 32u);
    ASSERT_EQ(TEE_MACComputeFinal(op, c.msg.data() + 10, u32(c.msg.size() - 10), out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out), c.mac);
    EXPECT_FALSE(handle_state(op) & TEE_HANDLE_FLAG_INITIALIZED) << "a final call ends the computation";
}

TEST_F(Crypto, HmacKeysOfTheMatchingTypeWorkAndAgreeWithOpenSsl) {
    std::mt19937 rng(11);
    const char *digests[] = {"MD5", "SHA1", "SHA224", "SHA256", "SHA384", "SHA512"};
    const uint32_t min_bits[] = {64, 80, 112, 192, 256, 256};
    for (uint32_t i = 0; i < 6; ++i) {
        Bytes key = random_bytes(rng, min_bits[i] / 8 + rng() % 8);
        Bytes msg = random_bytes(rng, rng() % 500);
        Op op(TEE_ALG_HMAC_MD5 + i, TEE_MODE_MAC, 512);
        Key k(TEE_TYPE_HMAC_MD5 + i, key, 512);
        ASSERT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        TEE_MACInit(op, nullptr, 0);
        Bytes out(64);
        uint32_t len = 64;
        ASSERT_EQ(TEE_MACComputeFinal(op, msg.data(), u32(msg.size()), out.data(), &len), TEE_SUCCESS);
        out.resize(len);
        Bytes want(64);
        size_t want_len = 0;
        ASSERT_NE(EVP_Q_mac(nullptr, "HMAC", nullptr, digests[i], nullptr, key.data(), key.size(), msg.data(),
                            msg.size(), want.data(), want.size(), &want_len),
                  nullptr);
        want.resize(want_len);
        EXPECT_EQ(out, want) << digests[i];
    }
}

// --- AES ECB / CBC / CTR -----------------------------------------------------------

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
    const char *cipher; // NIST SP 800-38A
};

const CipherCase kCiphers[] = {
    {TEE_ALG_AES_ECB_NOPAD, kKey128, "",
     "3ad77bb40d7a3660a89ecaf32466ef97f5d3d58503b9699de785895a96fdbaaf"
     "43b1cd7f598ece23881b00e3ed0306887b0c785e27e8ad3f8223207104725dd4"},
    {TEE_ALG_AES_ECB_NOPAD, kKey192, "",
     "bd334f1d6e45f25ff712a214571fa5cc974104846d0ad3ad7734ecb3ecee4eef"
     "ef7afd2270e2e60adce0ba2face6444e9a4b41ba738d6c72fb16691603c18e0e"},
    {TEE_ALG_AES_ECB_NOPAD, kKey256, "",
     "f3eed1bdb5d2a03c064b5a7e3db181f8591ccb10d410ed26dc5ba74a31362870"
     "b6ed21b99ca6f4f9f153e7b1beafed1d23304b7a39f9f3ff067d8d8f9e24ecc7"},
    {TEE_ALG_AES_CBC_NOPAD, kKey128, kCbcIv,
     "7649abac8119b246cee98e9b12e9197d5086cb9b507219ee95db113a917678b2"
     "73bed6b8e3c1743b7116e69e222295163ff1caa1681fac09120eca307586e1a7"},
    {TEE_ALG_AES_CBC_NOPAD, kKey256, kCbcIv,
     "f58c4c04d6e5f1ba779eabfb5f7bfbd69cfc4e967edb808d679f777bc6702c7d"
     "39f23369a9d9bacfa530e26304231461b2eb05e2c39be9fcda6c19078c6a9d1b"},
    {TEE_ALG_AES_CTR, kKey128, kCtrIv,
     "874d6191b620e3261bef6864990db6ce9806f66b7970fdff8617187bb9fffdff"
     "5ae4df3edbd5d35e5b4f09020db03eab1e031dda2fbe03d1792170a0f3009cee"},
    {TEE_ALG_AES_CTR, kKey256, kCtrIv,
     "601ec313775789a5b7a7f504bbf3d228f443e3ca4d62b59aca84e990cacaf5c5"
     "2b0930daa23de94ce87017ba2d84988ddfc9c58db67aada613c2dd08457941a6"},
};

// A keyed, initialized cipher operation.
struct Cipher {
    Op op;
    Cipher(uint32_t alg, uint32_t mode, const Bytes &key, const Bytes &iv) : op(alg, mode, 256) {
        Key k(TEE_TYPE_AES, key);
        EXPECT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        TEE_CipherInit(op, iv.data(), u32(iv.size()));
    }
};

// Runs input through updates of the given chunk sizes (cycled) and a
// final call, checking each call releases what the GP rules say.
Bytes run_cipher(TEE_OperationHandle op, const Bytes &in, std::initializer_list<size_t> chunks, bool stream) {
    Bytes out;
    size_t pos = 0;
    size_t held = 0;
    auto it = chunks.begin();
    while (chunks.size() && in.size() - pos > *it) {
        size_t n = *it;
        Bytes buf(n + 16);
        uint32_t len = u32(buf.size());
        EXPECT_EQ(TEE_CipherUpdate(op, in.data() + pos, u32(n), buf.data(), &len), TEE_SUCCESS);
        size_t expect = stream ? n : (held + n) / 16 * 16;
        EXPECT_EQ(len, expect) << "update of " << n << " after " << pos;
        held = stream ? 0 : (held + n) % 16;
        out.insert(out.end(), buf.begin(), buf.begin() + len);
        pos += n;
        if (++it == chunks.end())
            it = chunks.begin();
    }
    Bytes buf(in.size() - pos + 16);
    uint32_t len = u32(buf.size());
    EXPECT_EQ(TEE_CipherDoFinal(op, in.data() + pos, u32(in.size() - pos), buf.data(), &len), TEE_SUCCESS);
    out.insert(out.end(), buf.begin(), buf.begin() + len);
    return out;
}

TEST_F(Crypto, AesModesMatchSp80038aInBothDirectionsAndAnyChunking) {
    Bytes plain = hex(kPlain);
    for (const auto &c : kCiphers) {
        bool stream = c.alg == TEE_ALG_AES_CTR;
        Bytes want = hex(c.cipher);
        for (auto chunks : {std::initializer_list<size_t>{}, {1}, {7, 15, 17}, {16, 3, 29}}) {
            Cipher enc(c.alg, TEE_MODE_ENCRYPT, hex(c.key), hex(c.iv));
            EXPECT_EQ(to_hex(run_cipher(enc.op, plain, chunks, stream)), c.cipher) << std::hex << c.alg;
            Cipher dec(c.alg, TEE_MODE_DECRYPT, hex(c.key), hex(c.iv));
            EXPECT_EQ(to_hex(run_cipher(dec.op, want, chunks, stream)), kPlain) << std::hex << c.alg;
        }
    }
}

TEST_F(Crypto, CipherInPlaceWithPartialBlocksHeld) {
    for (const auto &c : {kCiphers[3], kCiphers[5]}) {
        Cipher enc(c.alg, TEE_MODE_ENCRYPT, hex(c.key), hex(c.iv));
        Bytes buf = hex(kPlain);
        // 5 bytes in, then 40 bytes updated in place over the same memory.
        uint32_t len = 64;
        ASSERT_EQ(TEE_CipherUpdate(enc.op, buf.data(), 5, buf.data(), &len), TEE_SUCCESS);
        uint32_t first = len;
        len = 64 - first;
        ASSERT_EQ(TEE_CipherUpdate(enc.op, buf.data() + 5, 40, buf.data() + first, &len), TEE_SUCCESS);
        uint32_t second = len;
        len = 64 - first - second;
        ASSERT_EQ(TEE_CipherDoFinal(enc.op, buf.data() + 45, 19, buf.data() + first + second, &len), TEE_SUCCESS);
        EXPECT_EQ(to_hex(buf), c.cipher) << std::hex << c.alg;
    }
}

TEST_F(Crypto, CipherShortBufferReportsTheSizeAndConsumesNothing) {
    const CipherCase &c = kCiphers[3]; // CBC
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

TEST_F(Crypto, NopadFinalOnAPartialBlockIsRefusedButCtrTakesAnyLength) {
    Bytes plain = hex(kPlain);
    Bytes out(80);
    for (uint32_t alg : {TEE_ALG_AES_ECB_NOPAD, TEE_ALG_AES_CBC_NOPAD}) {
        Cipher enc(alg, TEE_MODE_ENCRYPT, hex(kKey128), hex(kCbcIv));
        uint32_t len = 80;
        ASSERT_EQ(TEE_CipherUpdate(enc.op, plain.data(), 10, out.data(), &len), TEE_SUCCESS);
        len = 80;
        EXPECT_EQ(TEE_CipherDoFinal(enc.op, plain.data(), 5, out.data(), &len), TEE_ERROR_BAD_PARAMETERS);
        EXPECT_FALSE(handle_state(enc.op) & TEE_HANDLE_FLAG_INITIALIZED);
    }
    Cipher ctr(TEE_ALG_AES_CTR, TEE_MODE_ENCRYPT, hex(kKey128), hex(kCtrIv));
    uint32_t len = 80;
    ASSERT_EQ(TEE_CipherDoFinal(ctr.op, plain.data(), 23, out.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(to_hex(out.data(), len), std::string(kCiphers[5].cipher).substr(0, 46));
}

TEST_F(Crypto, CipherCopyMidStreamAndReinitRestart) {
    const CipherCase &c = kCiphers[4]; // CBC-256
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

TEST_F(Crypto, CtrAgreesWithOpenSslOverRandomChunks) {
    std::mt19937 rng(3);
    for (const char *name : {"AES-128-CTR", "AES-192-CTR", "AES-256-CTR"}) {
        size_t key_len = name[4] == '1' ? (name[5] == '2' ? 16 : 24) : 32;
        Bytes key = random_bytes(rng, key_len), iv = random_bytes(rng, 16), msg = random_bytes(rng, 3000);
        // A counter about to wrap its low 64 bits.
        std::fill(iv.begin() + 8, iv.end(), 0xFF);
        Cipher enc(TEE_ALG_AES_CTR, TEE_MODE_ENCRYPT, key, iv);
        Bytes got = run_cipher(enc.op, msg, {1, 31, 200, 17, 64}, true);

        EVP_CIPHER *cipher = EVP_CIPHER_fetch(nullptr, name, nullptr);
        EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
        Bytes want(msg.size());
        int n = 0;
        ASSERT_EQ(EVP_EncryptInit_ex2(ctx, cipher, key.data(), iv.data(), nullptr), 1);
        ASSERT_EQ(EVP_EncryptUpdate(ctx, want.data(), &n, msg.data(), static_cast<int>(msg.size())), 1);
        EVP_CIPHER_CTX_free(ctx);
        EVP_CIPHER_free(cipher);
        EXPECT_EQ(got, want) << name;
    }
}

// --- AES-GCM -----------------------------------------------------------------------

const char *kGcmKey = "feffe9928665731c6d6a8f9467308308";
const char *kGcmPlain = "d9313225f88406e5a55909c5aff5269a86a7a9531534f7da2e4c303d8a318a72"
                        "1c3c0c95956809532fcf0e2449a6b525b16aedf5aa0de657ba637b39";
const char *kGcmAad = "feedfacedeadbeeffeedfacedeadbeefabaddad2";

struct GcmCase {
    const char *nonce;
    const char *cipher;
    const char *tag;
};

// The GCM submission's test cases 4, 5 and 6: 96-, 64- and 480-bit nonces.
const GcmCase kGcm[] = {
    {"cafebabefacedbaddecaf888",
     "42831ec2217774244b7221b784d0d49ce3aa212f2c02a4e035c17e2329aca12e"
     "21d514b25466931c7d8f6a5aac84aa051ba30b396a0aac973d58e091",
     "5bc94fbc3221a5db94fae95ae7121a47"},
    {"cafebabefacedbad",
     "61353b4c2806934a777ff51fa22a4755699b2a714fcdc6f83766e5f97b6c7423"
     "73806900e49f24b22b097544d4896b424989b5e1ebac0f07c23f4598",
     "3612d2e79e3b0785561be14aaca2fccb"},
    {"9313225df88406e555909c5aff5269aa6a7a9538534f7da1e4c303d2a318a728"
     "c3c0c95156809539fcf0e2429a6b525416aedbf5a0de6a57a637b39b",
     "8ce24998625615b603a033aca13fb894be9112a5c3a211a8ba262a3cca7e2ca7"
     "01e4a9a4fba43c90ccdcb281d48c7c6fd62875d2aca417034c34aee5",
     "619cc5aefffe0bfa462af43c1699d050"},
};

struct Gcm {
    Op op;
    Gcm(uint32_t mode, const Bytes &key, const Bytes &nonce, uint32_t tag_bits) : op(TEE_ALG_AES_GCM, mode, 256) {
        Key k(TEE_TYPE_AES, key);
        EXPECT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), u32(nonce.size()), tag_bits, 0, 0), TEE_SUCCESS);
    }
};

// Encrypts with the AAD in two pieces and the payload in `chunk`-sized updates.
void gcm_encrypt(const GcmCase &c, size_t chunk, uint32_t tag_bits, Bytes *out, Bytes *tag) {
    Gcm g(TEE_MODE_ENCRYPT, hex(kGcmKey), hex(c.nonce), tag_bits);
    Bytes aad = hex(kGcmAad), plain = hex(kGcmPlain);
    TEE_AEUpdateAAD(g.op, aad.data(), 7);
    TEE_AEUpdateAAD(g.op, aad.data() + 7, u32(aad.size() - 7));
    out->assign(plain.size(), 0);
    size_t pos = 0;
    for (; chunk && pos + chunk < plain.size(); pos += chunk) {
        uint32_t len = u32(chunk);
        ASSERT_EQ(TEE_AEUpdate(g.op, plain.data() + pos, u32(chunk), out->data() + pos, &len), TEE_SUCCESS);
        ASSERT_EQ(len, chunk);
    }
    uint32_t len = u32(plain.size() - pos);
    tag->assign(16, 0);
    uint32_t tag_len = 16;
    ASSERT_EQ(TEE_AEEncryptFinal(g.op, plain.data() + pos, len, out->data() + pos, &len, tag->data(), &tag_len),
              TEE_SUCCESS);
    tag->resize(tag_len);
}

// Decrypts, optionally with one byte of the ciphertext, tag or AAD altered.
// The plaintext buffer starts as 0xEE so that any release shows. The tag
// length announced at Init is the given tag's unless tag_bits says otherwise.
TEE_Result gcm_decrypt(const GcmCase &c, Bytes cipher, Bytes tag, Bytes aad, Bytes *plain, uint32_t tag_bits = 0) {
    Gcm g(TEE_MODE_DECRYPT, hex(kGcmKey), hex(c.nonce), tag_bits ? tag_bits : u32(tag.size() * 8));
    TEE_AEUpdateAAD(g.op, aad.data(), u32(aad.size()));
    plain->assign(cipher.size(), 0xEE);
    uint32_t len = 16;
    EXPECT_EQ(TEE_AEUpdate(g.op, cipher.data(), 16, plain->data(), &len), TEE_SUCCESS);
    std::fill(plain->begin(), plain->end(), 0xEE);
    len = u32(cipher.size() - 16);
    TEE_Result res = TEE_AEDecryptFinal(g.op, cipher.data() + 16, len, plain->data() + 16, &len, tag.data(),
                                        u32(tag.size()));
    if (res == TEE_SUCCESS) {
        EXPECT_EQ(len, cipher.size() - 16);
    }
    return res;
}

TEST_F(Crypto, GcmEncryptMatchesTheTestCasesForEveryNonceLengthAndChunking) {
    for (const auto &c : kGcm) {
        for (size_t chunk : {size_t{0}, size_t{1}, size_t{13}, size_t{16}}) {
            Bytes out, tag;
            gcm_encrypt(c, chunk, 128, &out, &tag);
            EXPECT_EQ(to_hex(out), c.cipher) << c.nonce << " chunk " << chunk;
            EXPECT_EQ(to_hex(tag), c.tag);
        }
        // A shorter tag is the leading part of the full one.
        Bytes out, tag;
        gcm_encrypt(c, 0, 96, &out, &tag);
        EXPECT_EQ(to_hex(tag), std::string(c.tag).substr(0, 24));
    }
}

TEST_F(Crypto, GcmDecryptReleasesNothingWhenAnythingWasAltered) {
    const GcmCase &c = kGcm[0];
    Bytes cipher = hex(c.cipher), tag = hex(c.tag), aad = hex(kGcmAad), plain;
    ASSERT_EQ(gcm_decrypt(c, cipher, tag, aad, &plain), TEE_SUCCESS);
    EXPECT_EQ(to_hex(plain.data() + 16, plain.size() - 16), std::string(kGcmPlain).substr(32));

    auto altered = [](Bytes b, size_t i) {
        b[i] ^= 0x80;
        return b;
    };
    auto refused = [&](const char *what, const Bytes &ci, const Bytes &t, const Bytes &a) {
        Bytes out;
        EXPECT_EQ(gcm_decrypt(c, ci, t, a, &out, 128), TEE_ERROR_MAC_INVALID) << what;
        EXPECT_EQ(out, Bytes(out.size(), 0xEE)) << what << ": the final call released plaintext";
    };
    refused("tag", cipher, altered(tag, 15), aad);
    refused("early ciphertext", altered(cipher, 3), tag, aad);
    refused("final ciphertext", altered(cipher, 40), tag, aad);
    refused("aad", cipher, tag, altered(aad, 19));
    refused("tag shorter than announced", cipher, Bytes(tag.begin(), tag.end() - 4), aad);

    // A tag announced as 96 bits is checked as the full tag's first 12 bytes.
    Bytes out, tag96;
    gcm_encrypt(c, 0, 96, &out, &tag96);
    EXPECT_EQ(gcm_decrypt(c, cipher, tag96, aad, &plain), TEE_SUCCESS);
    tag96.back() ^= 1;
    EXPECT_EQ(gcm_decrypt(c, cipher, tag96, aad, &plain), TEE_ERROR_MAC_INVALID);
}

TEST_F(Crypto, GcmTagLengthsAndShortBuffers) {
    Bytes key = hex(kGcmKey), nonce = hex(kGcm[0].nonce);
    Op op(TEE_ALG_AES_GCM, TEE_MODE_ENCRYPT, 128);
    Key k(TEE_TYPE_AES, key);
    ASSERT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
    for (uint32_t bits : {0u, 24u, 100u, 136u, 256u})
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), 12, bits, 0, 0), TEE_ERROR_NOT_SUPPORTED) << bits;
    EXPECT_EQ(TEE_AEInit(op, nonce.data(), 0, 128, 0, 0), TEE_ERROR_NOT_SUPPORTED);
    for (uint32_t bits : {32u, 64u, 96u, 104u, 112u, 120u, 128u})
        EXPECT_EQ(TEE_AEInit(op, nonce.data(), 12, bits, 0, 0), TEE_SUCCESS) << bits;

    Bytes aad = hex(kGcmAad), plain = hex(kGcmPlain), out(plain.size()), tag(16);
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
    EXPECT_EQ(to_hex(out), kGcm[0].cipher);
    EXPECT_EQ(to_hex(tag), kGcm[0].tag);
}

TEST_F(Crypto, GcmAgreesWithOpenSslForRandomInputs) {
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

        const char *names[] = {"AES-128-GCM", "AES-192-GCM", "AES-256-GCM"};
        EVP_CIPHER *cipher = EVP_CIPHER_fetch(nullptr, names[round % 3], nullptr);
        EVP_CIPHER_CTX *ctx = EVP_CIPHER_CTX_new();
        size_t iv_len = nonce.size();
        OSSL_PARAM iv_params[] = {OSSL_PARAM_construct_size_t(OSSL_CIPHER_PARAM_AEAD_IVLEN, &iv_len), OSSL_PARAM_construct_end()};
        ASSERT_EQ(EVP_EncryptInit_ex2(ctx, cipher, nullptr, nullptr, iv_params), 1);
        ASSERT_EQ(EVP_EncryptInit_ex2(ctx, nullptr, key.data(), nonce.data(), nullptr), 1);
        int n = 0;
        Bytes want(msg.size() + 16), want_tag(16);
        ASSERT_EQ(EVP_EncryptUpdate(ctx, nullptr, &n, aad.data(), static_cast<int>(aad.size())), 1);
        ASSERT_EQ(EVP_EncryptUpdate(ctx, want.data(), &n, msg.data(), static_cast<int>(msg.size())), 1);
        want.resize(static_cast<size_t>(n));
        ASSERT_EQ(EVP_EncryptFinal_ex(ctx, want_tag.data(), &n), 1);
        OSSL_PARAM tag_params[] = {OSSL_PARAM_construct_octet_string(OSSL_CIPHER_PARAM_AEAD_TAG, want_tag.data(), 16),
                                   OSSL_PARAM_construct_end()};
        ASSERT_EQ(EVP_CIPHER_CTX_get_params(ctx, tag_params), 1);
        EVP_CIPHER_CTX_free(ctx);
        EVP_CIPHER_free(cipher);
        EXPECT_EQ(out, want);
        EXPECT_EQ(tag, want_tag);
    }
}

// --- Allocation, keys and state ----------------------------------------------------

TEST_F(Crypto, AllocationRefusesWhatIsNotSupported) {
    struct {
        uint32_t alg, mode, max;
    } refused[] = {
        {TEE_ALG_AES_CBC_NOPAD, TEE_MODE_ENCRYPT, 100}, {TEE_ALG_AES_CBC_NOPAD, TEE_MODE_MAC, 128},
        {TEE_ALG_AES_GCM, TEE_MODE_SIGN, 128},          {TEE_ALG_AES_CTS, TEE_MODE_ENCRYPT, 128},
        {TEE_ALG_AES_XTS, TEE_MODE_ENCRYPT, 256},       {TEE_ALG_AES_CMAC, TEE_MODE_MAC, 128},
        {TEE_ALG_AES_CCM, TEE_MODE_ENCRYPT, 128},       {TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 4104},
        {TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 7},         {TEE_ALG_HMAC_SHA1, TEE_MODE_ENCRYPT, 160},
        {TEE_ALG_SHA256, TEE_MODE_MAC, 0},              {TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, TEE_MODE_ENCRYPT, 2048},
        {TEE_ALG_ECDSA_P256, TEE_MODE_SIGN, 256},       {0x12345678, TEE_MODE_DIGEST, 0},
    };
    for (const auto &r : refused) {
        TEE_OperationHandle op = reinterpret_cast<TEE_OperationHandle>(1);
        EXPECT_EQ(TEE_AllocateOperation(&op, r.alg, r.mode, r.max), TEE_ERROR_NOT_SUPPORTED) << std::hex << r.alg;
        EXPECT_EQ(op, nullptr);
    }
    EXPECT_EQ(tee_host::handles::live_operations(), 0u);
}

TEST_F(Crypto, AllocationFailsCleanlyWhenTheHeapDoes) {
    TEE_OperationHandle op = TEE_HANDLE_NULL;
    tee_host::heap::fail_nth(1);
    EXPECT_EQ(TEE_AllocateOperation(&op, TEE_ALG_SHA256, TEE_MODE_DIGEST, 0), TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_TRUE(tee_host::heap::injected_failure_fired());
    EXPECT_EQ(op, nullptr);
    EXPECT_EQ(tee_host::handles::live_operations(), 0u);
}

TEST_F(Crypto, InfoFollowsKeyInitAndFinal) {
    Op op(TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 512);
    TEE_OperationInfo info{};
    TEE_GetOperationInfo(op, &info);
    EXPECT_EQ(info.algorithm, TEE_ALG_HMAC_SHA256);
    EXPECT_EQ(info.operationClass, TEE_OPERATION_MAC);
    EXPECT_EQ(info.mode, TEE_MODE_MAC);
    EXPECT_EQ(info.digestLength, 32u);
    EXPECT_EQ(info.maxKeySize, 512u);
    EXPECT_EQ(info.keySize, 0u);
    EXPECT_EQ(info.requiredKeyUsage, TEE_USAGE_MAC);
    EXPECT_EQ(info.handleState, 0u);

    Bytes secret(40, 0x11);
    {
        Key k(TEE_TYPE_HMAC_SHA256, secret, 512);
        ASSERT_EQ(TEE_SetOperationKey(op, k), TEE_SUCCESS);
    } // the operation keeps its own copy of the key
    TEE_GetOperationInfo(op, &info);
    EXPECT_EQ(info.keySize, 320u);
    EXPECT_EQ(info.handleState, TEE_HANDLE_FLAG_KEY_SET);
    TEE_MACInit(op, nullptr, 0);
    EXPECT_EQ(handle_state(op), TEE_HANDLE_FLAG_KEY_SET | TEE_HANDLE_FLAG_INITIALIZED);
    Bytes mac(32);
    uint32_t len = 32;
    ASSERT_EQ(TEE_MACComputeFinal(op, "x", 1, mac.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(handle_state(op), TEE_HANDLE_FLAG_KEY_SET);
    EXPECT_EQ(mac, compute_mac(TEE_ALG_HMAC_SHA256, secret, text("x"), 0));

    // Clearing the key takes the operation back to its first state.
    ASSERT_EQ(TEE_SetOperationKey(op, TEE_HANDLE_NULL), TEE_SUCCESS);
    TEE_GetOperationInfo(op, &info);
    EXPECT_EQ(info.handleState, 0u);
    EXPECT_EQ(info.keySize, 0u);
}

// --- Misuse panics ------------------------------------------------------------------

using CryptoDeathTest = Crypto;

TEST_F(CryptoDeathTest, HandleMisusePanics) {
    TEE_OperationHandle freed = TEE_HANDLE_NULL;
    ASSERT_EQ(TEE_AllocateOperation(&freed, TEE_ALG_SHA1, TEE_MODE_DIGEST, 0), TEE_SUCCESS);
    TEE_FreeOperation(freed);
    EXPECT_DEATH(TEE_DigestUpdate(freed, "a", 1), "invalid or freed operation handle");
    EXPECT_DEATH(TEE_FreeOperation(freed), "invalid or freed operation handle");
    Key k(TEE_TYPE_AES, Bytes(16));
    EXPECT_DEATH(TEE_FreeOperation(reinterpret_cast<TEE_OperationHandle>(k.h)), "invalid or freed operation");
    EXPECT_DEATH(TEE_GetOperationInfo(TEE_HANDLE_NULL, nullptr), "null operation handle");
}

TEST_F(CryptoDeathTest, WrongClassModeOrStatePanics) {
    Op mac(TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 256);
    Op digest(TEE_ALG_SHA256, TEE_MODE_DIGEST, 0);
    Op gcm_dec(TEE_ALG_AES_GCM, TEE_MODE_DECRYPT, 128);
    Op cbc(TEE_ALG_AES_CBC_NOPAD, TEE_MODE_ENCRYPT, 128);
    Key aes(TEE_TYPE_AES, Bytes(16, 1));
    Key sha1_key(TEE_TYPE_HMAC_SHA1, Bytes(20, 1));
    uint8_t buf[64] = {};
    uint32_t len = sizeof buf;

    EXPECT_DEATH(TEE_DigestUpdate(mac, "a", 1), "wrong class");
    EXPECT_DEATH(TEE_CipherInit(mac, nullptr, 0), "wrong class");
    EXPECT_DEATH(TEE_AsymmetricSignDigest(digest, nullptr, 0, buf, 32, buf, &len), "wrong class");
    EXPECT_DEATH(TEE_MACInit(mac, nullptr, 0), "before its key was set");
    EXPECT_DEATH(TEE_SetOperationKey(digest, aes), "digest operation");
    EXPECT_DEATH(TEE_SetOperationKey(mac, aes), "wrong type");
    EXPECT_DEATH(TEE_SetOperationKey(mac, sha1_key), "wrong type");
    EXPECT_DEATH(TEE_ResetOperation(cbc), "before its key was set");

    ASSERT_EQ(TEE_SetOperationKey(cbc, aes), TEE_SUCCESS);
    EXPECT_DEATH(TEE_CipherUpdate(cbc, buf, 16, buf, &len), "before it was initialized");
    EXPECT_DEATH(TEE_CipherInit(cbc, buf, 8), "16-byte IV");
    TEE_CipherInit(cbc, buf, 16);
    EXPECT_DEATH(TEE_SetOperationKey(cbc, aes), "active operation");
    EXPECT_DEATH(TEE_CipherUpdate(cbc, buf, 16, buf, nullptr), "null output length");

    ASSERT_EQ(TEE_SetOperationKey(gcm_dec, aes), TEE_SUCCESS);
    ASSERT_EQ(TEE_AEInit(gcm_dec, buf, 12, 128, 0, 0), TEE_SUCCESS);
    uint32_t tag_len = 16;
    EXPECT_DEATH(TEE_AEEncryptFinal(gcm_dec, buf, 0, buf, &len, buf, &tag_len), "wrong mode");
    ASSERT_EQ(TEE_AEUpdate(gcm_dec, buf, 16, buf, &len), TEE_SUCCESS);
    EXPECT_DEATH(TEE_AEUpdateAAD(gcm_dec, buf, 4), "after payload");

    Op small(TEE_ALG_AES_ECB_NOPAD, TEE_MODE_ENCRYPT, 128);
    Key aes256(TEE_TYPE_AES, Bytes(32, 1));
    EXPECT_DEATH(TEE_SetOperationKey(small, aes256), "larger than the operation's maximum");
    Op other(TEE_ALG_SHA1, TEE_MODE_DIGEST, 0);
    EXPECT_DEATH(TEE_CopyOperation(other, digest), "different algorithm");
}

} // namespace
