/*
 * fuzz_support_test.cpp - what fuzzing relies on, through the command
 * interface: blobs sealed around payloads of the test's choosing open like
 * the TA's own, the TA heap catches a one-byte overrun in sanitizer
 * builds, and the regressions the fuzzers' seeds turned up.
 */
#include <cstring>

#include "blob_seal.h"
#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

using km::ParamSet;

namespace {

class SealTest : public KeyTest {
  protected:
    // payload - what a blob opens to, through command 27 from a trusted TA.
    Bytes payload(const Bytes &blob) {
        const uint32_t trusted = open(&trusted_client_uuids[0]);
        Bytes out;
        EXPECT_EQ(open_raw(trusted, blob, &out), TEE_SUCCESS);
        tee_->close_session(trusted);
        return out;
    }
};

TEST_F(SealTest, ResealedPayloadsOpenLikeTheTasOwnBlobs) {
    Bytes blob;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok());
    const Bytes inside = payload(blob);
    ASSERT_EQ(inside.size(), blob.size() - kBlobHeaderSize);

    const auto sealed = seal_payload(inside);
    ASSERT_TRUE(sealed.has_value());
    EXPECT_EQ(sealed->size(), blob.size());
    EXPECT_NE(*sealed, blob); // fresh derivation bytes, nonce and tag
    Bytes theirs, mine;
    ASSERT_TRUE(characteristics(key_reference(blob), &theirs).ok());
    ASSERT_TRUE(characteristics(key_reference(*sealed), &mine).ok());
    EXPECT_EQ(mine, theirs);
    EXPECT_EQ(payload(*sealed), inside);

    uint32_t handle = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, *sealed, ParamSet().add(KM_TAG_MAC_LENGTH, 256), &handle).ok());
    Bytes mac;
    EXPECT_TRUE(finish(handle, {}, {}, &mac).ok());
    EXPECT_EQ(mac.size(), 32u);
}

TEST_F(SealTest, PayloadsNoBlobCanCarryReachTheParser) {
    // A key-data length past the end of the payload: only a sealed payload gets here.
    Bytes cut = {0xFF, 0xFF, 0x00, 0x00, 1, 2, 3};
    Bytes out;
    EXPECT_EQ(characteristics(key_reference(*seal_payload(cut)), &out), (Outcome{TEE_ERROR_GENERIC, 0}));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key", "Too short input")) << dump_log();

    // Whole fields around a parameter set that does not parse.
    Bytes bad;
    km::put_lv(bad, Bytes(4, 7));
    km::put_lv(bad, Bytes{5, 0, 0, 0});
    EXPECT_EQ(characteristics(key_reference(*seal_payload(bad)), &out),
              (Outcome{TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}));
    EXPECT_EQ(extra_allocations(), 0u);
}

#if defined(__SANITIZE_ADDRESS__)
TEST(TaHeapDeathTest, OneByteOverrunIsReported) {
    tee_host::Tee tee;
    EXPECT_DEATH(
        {
            auto *p = static_cast<volatile uint8_t *>(TEE_MallocAt(5, TEE_MALLOC_FILL_ZERO, __FILE__, __LINE__));
            p[5] = 1;
        },
        "AddressSanitizer");
    EXPECT_DEATH(
        {
            auto *p = static_cast<volatile uint8_t *>(TEE_MallocAt(0, TEE_MALLOC_FILL_ZERO, __FILE__, __LINE__));
            (void)p[0];
        },
        "AddressSanitizer");
    auto *ok = static_cast<uint8_t *>(TEE_MallocAt(8, TEE_MALLOC_FILL_ZERO, __FILE__, __LINE__));
    std::memset(ok, 1, 8); // the block's own bytes stay usable
    ok = static_cast<uint8_t *>(TEE_ReallocAt(ok, 3, __FILE__, __LINE__));
    ASSERT_NE(ok, nullptr);
    EXPECT_EQ(ok[2], 1);
    TEE_Free(ok);
}
#endif

class UseLimitsTest : public KeyTest {};

// Found by the command fuzzer's seeds: a key with a use count listed before
// its rate limit was refused as "too soon" on its first use within the
// first seconds after boot, as if the count's entry were a last use at 0.
TEST_F(UseLimitsTest, FirstUseOfACountedRateLimitedKeyRightAfterBootPasses) {
    tee_host::clock::freeze(); // system time stays within the Tee's first seconds
    ParamSet params = hmac_params();
    params.add(KM_TAG_MAX_USES_PER_BOOT, 3).add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 5);
    Bytes blob;
    ASSERT_TRUE(generate(params, &blob).ok());
    const ParamSet op = ParamSet().add(KM_TAG_MAC_LENGTH, 256);
    uint32_t handle = 0;
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, op, &handle).ok()) << dump_log();
    EXPECT_TRUE(abort(handle).ok());
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, op, &handle), (Outcome{TEE_SUCCESS, KM_ERROR_KEY_RATE_LIMIT_EXCEEDED}));
    tee_host::clock::advance_ms(6000);
    ASSERT_TRUE(begin(KM_PURPOSE_SIGN, blob, op, &handle).ok());
    EXPECT_TRUE(abort(handle).ok());
    // The count still holds: the first rate-limited refusal was counted too.
    tee_host::clock::advance_ms(6000);
    EXPECT_EQ(begin(KM_PURPOSE_SIGN, blob, op, &handle), (Outcome{TEE_SUCCESS, KM_ERROR_KEY_MAX_OPS_EXCEEDED}));
}

} // namespace
