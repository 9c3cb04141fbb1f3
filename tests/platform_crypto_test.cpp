/*
 * The platform's crypto operations: digests and HMAC against the standards'
 * known answers and against OpenSSL called directly, the GP output-size and
 * state rules shared by every family, the panics on misuse, and the crypto
 * state a Tee owns from its start to its end. AES is in
 * platform_aes_test.cpp, RSA and EC in their own suites.
 */
#include <cstdlib>
#include <cstring>
#include <random>

#include <openssl/core_names.h>
#include <openssl/evp.h>
#include <openssl/params.h>

#include "gp_handles.h"
#include "ta_entry.h"

namespace {

class Crypto : public TeeTest {};

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
    {TEE_ALG_SHA384,
     "cb00753f45a35e8bb5a03d699ac65007272c32ab0eded1631a8b605a43ff5bed8086072ba1e7cc2358baeca134c825a7"},
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
    EXPECT_FALSE(op.handle_state() & TEE_HANDLE_FLAG_INITIALIZED) << "a final call ends the computation";
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

// --- Allocation, keys and state ----------------------------------------------------

TEST_F(Crypto, AllocationRefusesWhatIsNotSupported) {
    struct {
        uint32_t alg, mode, max;
    } refused[] = {
        {TEE_ALG_AES_CBC_NOPAD, TEE_MODE_ENCRYPT, 100},
        {TEE_ALG_AES_CBC_NOPAD, TEE_MODE_MAC, 128},
        {TEE_ALG_AES_GCM, TEE_MODE_SIGN, 128},
        {TEE_ALG_AES_CTS, TEE_MODE_ENCRYPT, 128},
        {TEE_ALG_AES_XTS, TEE_MODE_ENCRYPT, 256},
        {TEE_ALG_AES_CMAC, TEE_MODE_MAC, 128},
        {TEE_ALG_AES_CCM, TEE_MODE_ENCRYPT, 128},
        {TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 4104},
        {TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 7},
        {TEE_ALG_HMAC_SHA1, TEE_MODE_ENCRYPT, 160},
        {TEE_ALG_SHA256, TEE_MODE_MAC, 0},
        {TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, TEE_MODE_ENCRYPT, 2048},
        {TEE_ALG_ECDH_P256, TEE_MODE_DERIVE, 256},
        {0x12345678, TEE_MODE_DIGEST, 0},
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
    EXPECT_EQ(op.handle_state(), TEE_HANDLE_FLAG_KEY_SET | TEE_HANDLE_FLAG_INITIALIZED);
    Bytes mac(32);
    uint32_t len = 32;
    ASSERT_EQ(TEE_MACComputeFinal(op, "x", 1, mac.data(), &len), TEE_SUCCESS);
    EXPECT_EQ(op.handle_state(), TEE_HANDLE_FLAG_KEY_SET);
    EXPECT_EQ(mac, compute_mac(TEE_ALG_HMAC_SHA256, secret, text("x"), 0));

    // Clearing the key takes the operation back to its first state.
    ASSERT_EQ(TEE_SetOperationKey(op, TEE_HANDLE_NULL), TEE_SUCCESS);
    TEE_GetOperationInfo(op, &info);
    EXPECT_EQ(info.handleState, 0u);
    EXPECT_EQ(info.keySize, 0u);
}

// --- The crypto state a Tee owns -----------------------------------------------------

struct StateUse {
    bool ok = true;
    Bytes mac; // depends on nothing but the fixed key and message
};

// use_every_cache - one use of each family that keeps state between calls: a
// keyed HMAC, RSA and EC signatures on prepared keys, AES-GCM and AES-CBC on
// fetched ciphers. Plain checks, so that it also runs in a child process.
StateUse use_every_cache() {
    StateUse u;
    auto check = [&u](bool c) { u.ok = u.ok && c; };
    {
        Key k(TEE_TYPE_HMAC_SHA256, Bytes(32, 0x42));
        Op op(TEE_ALG_HMAC_SHA256, TEE_MODE_MAC, 256, k);
        TEE_MACInit(op, nullptr, 0);
        u.mac.assign(32, 0);
        uint32_t len = 32;
        check(TEE_MACComputeFinal(op, "state", 5, u.mac.data(), &len) == TEE_SUCCESS);
    }
    Bytes digest(32, 0x17), sig(128);
    {
        Obj pair(TEE_TYPE_RSA_KEYPAIR, 512);
        check(TEE_GenerateKey(pair, 512, nullptr, 0) == TEE_SUCCESS);
        Op sign(TEE_ALG_RSASSA_PKCS1_V1_5_SHA256, TEE_MODE_SIGN, 512, pair);
        uint32_t len = u32(sig.size());
        check(TEE_AsymmetricSignDigest(sign, nullptr, 0, digest.data(), 32, sig.data(), &len) == TEE_SUCCESS);
    }
    {
        Obj pair(TEE_TYPE_ECDSA_KEYPAIR, 256);
        TEE_Attribute curve = value_attr(TEE_ATTR_ECC_CURVE, TEE_ECC_CURVE_NIST_P256);
        check(TEE_GenerateKey(pair, 256, &curve, 1) == TEE_SUCCESS);
        Op sign(TEE_ALG_ECDSA_P256, TEE_MODE_SIGN, 256, pair);
        uint32_t len = u32(sig.size());
        check(TEE_AsymmetricSignDigest(sign, nullptr, 0, digest.data(), 32, sig.data(), &len) == TEE_SUCCESS);
    }
    {
        Key k(TEE_TYPE_AES, Bytes(32, 0x24));
        Op gcm(TEE_ALG_AES_GCM, TEE_MODE_ENCRYPT, 256, k);
        check(TEE_AEInit(gcm, digest.data(), 12, 128, 0, 0) == TEE_SUCCESS);
        Bytes out(32), tag(16);
        uint32_t len = 32, tag_len = 16;
        check(TEE_AEEncryptFinal(gcm, digest.data(), 32, out.data(), &len, tag.data(), &tag_len) == TEE_SUCCESS);
        Op cbc(TEE_ALG_AES_CBC_NOPAD, TEE_MODE_ENCRYPT, 256, k);
        TEE_CipherInit(cbc, digest.data(), 16);
        len = 32;
        check(TEE_CipherDoFinal(cbc, digest.data(), 32, out.data(), &len) == TEE_SUCCESS);
    }
    return u;
}

std::vector<uint64_t> counts(const tee_host::PreparedKeyStats &s) {
    return {s.hits, s.misses, s.size};
}

TEST_F(Crypto, EveryTeeStartsWithEmptyCaches) {
    Bytes first_mac;
    for (int i = 0; i < 12; ++i) {
        restart();
        EXPECT_EQ(counts(tee_host::rsa_cache::stats()), (std::vector<uint64_t>{0, 0, 0})) << "start " << i;
        EXPECT_EQ(counts(tee_host::ec_cache::stats()), (std::vector<uint64_t>{0, 0, 0})) << "start " << i;
        StateUse u = use_every_cache();
        ASSERT_TRUE(u.ok) << "start " << i;
        // The RSA key is prepared at its first use; the EC key is kept as it
        // is generated, and its signature finds it.
        EXPECT_EQ(counts(tee_host::rsa_cache::stats()), (std::vector<uint64_t>{0, 1, 1}));
        EXPECT_EQ(counts(tee_host::ec_cache::stats()), (std::vector<uint64_t>{1, 1, 1}));
        if (i == 0)
            first_mac = u.mac;
        EXPECT_EQ(u.mac, first_mac) << "a keyed MAC kept from an earlier Tee";
    }
    tee_.reset();
    EXPECT_EQ(counts(tee_host::rsa_cache::stats()), (std::vector<uint64_t>{0, 0, 0})) << "no Tee, no cache";
    restart(); // for TearDown
}

// A Tee kept in a static outlives the function-local statics made after it
// started; at process exit it must end (closing a TA session, freeing what
// the crypto families keep) without touching any of them. The child
// process starts fresh, so that nothing of the platform exists before its
// Tee, and exits with the session still open.
[[noreturn]] void exit_with_a_tee_in_a_static() {
    static tee_host::Tee tee;
    tee.install_ta(&keymaster_ta_header);
    uint32_t session = 0;
    if (tee.open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session) != TEE_SUCCESS)
        std::_Exit(2);
    if (!use_every_cache().ok)
        std::_Exit(3);
    std::exit(0);
}

TEST(TeeLifetime, ATeeInAStaticEndsCleanlyAtProcessExit) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(exit_with_a_tee_in_a_static(), ::testing::ExitedWithCode(0), "");
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
    Key aes(TEE_TYPE_AES, Bytes(16, 1));
    Key sha1_key(TEE_TYPE_HMAC_SHA1, Bytes(20, 1));
    uint8_t buf[64] = {};
    uint32_t len = sizeof buf;

    EXPECT_DEATH(TEE_DigestUpdate(mac, "a", 1), "wrong class");
    EXPECT_DEATH(TEE_CipherInit(mac, nullptr, 0), "wrong class");
    EXPECT_DEATH(TEE_AsymmetricSignDigest(digest, nullptr, 0, buf, 32, buf, &len), "wrong class");
    EXPECT_DEATH(TEE_MACInit(mac, nullptr, 0), "before its key was set");
    EXPECT_DEATH(TEE_ResetOperation(mac), "before its key was set");
    EXPECT_DEATH(TEE_SetOperationKey(digest, aes), "digest operation");
    EXPECT_DEATH(TEE_SetOperationKey(mac, aes), "wrong type");
    EXPECT_DEATH(TEE_SetOperationKey(mac, sha1_key), "wrong type");
    Op other(TEE_ALG_SHA1, TEE_MODE_DIGEST, 0);
    EXPECT_DEATH(TEE_CopyOperation(other, digest), "different algorithm");
}

} // namespace
