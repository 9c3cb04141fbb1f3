/*
 * Parameter sets: lookups, ownership on add and release, and the dump.
 */
#include <cstring>

#include "keymaster_defs.h"
#include "ta_fixture.h"

namespace {

class ParamSet : public TaTest {
  protected:
    void TearDown() override {
        key_param_set_release(&set_);
        TaTest::TearDown();
    }
    void add(key_param_t p) { ASSERT_EQ(key_param_set_add(&set_, p), TEE_SUCCESS); }
    key_param_t bytes(uint32_t tag, const char *text) {
        key_param_t p{};
        p.tag = tag;
        p.blob.data_length = static_cast<uint32_t>(std::strlen(text));
        p.blob.data = static_cast<uint8_t *>(ta_malloc(p.blob.data_length));
        std::memcpy(p.blob.data, text, p.blob.data_length);
        return p;
    }
    keymaster_key_param_set_t set_{};
};

TEST_F(ParamSet, LookupsCountWholeTags) {
    add(key_param_enum(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256));
    add(key_param_enum(KM_TAG_DIGEST, KM_DIGEST_SHA1));
    add(key_param_enum(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC));
    add(key_param_enum(0x30000002, 7)); // KM_TAG_ALGORITHM's number with another type

    EXPECT_EQ(key_param_set_count_tag(&set_, KM_TAG_DIGEST), 2);
    EXPECT_TRUE(key_param_set_has_tag(&set_, KM_TAG_DIGEST));
    EXPECT_FALSE(key_param_set_at_most_one(&set_, KM_TAG_DIGEST));
    EXPECT_EQ(key_param_set_find_unique(&set_, KM_TAG_DIGEST), nullptr);

    EXPECT_EQ(key_param_set_count_tag(&set_, KM_TAG_PADDING), 0);
    EXPECT_FALSE(key_param_set_has_tag(&set_, KM_TAG_PADDING));
    EXPECT_TRUE(key_param_set_at_most_one(&set_, KM_TAG_PADDING));
    EXPECT_EQ(key_param_set_find_unique(&set_, KM_TAG_PADDING), nullptr);

    key_param_t *alg = key_param_set_find_unique(&set_, KM_TAG_ALGORITHM);
    ASSERT_NE(alg, nullptr);
    EXPECT_EQ(alg->enumerated, KM_ALGORITHM_HMAC);
    EXPECT_EQ(alg, &set_.params[2]);

    keymaster_key_param_set_t empty{};
    EXPECT_EQ(key_param_set_count_tag(&empty, KM_TAG_DIGEST), 0);
    EXPECT_EQ(key_param_set_find_unique(&empty, KM_TAG_DIGEST), nullptr);
    EXPECT_EQ(key_param_set_find_unique(nullptr, KM_TAG_DIGEST), nullptr);
}

TEST_F(ParamSet, AddGrowsByOneAndTheSetOwnsByteStrings) {
    add(bytes(KM_TAG_APPLICATION_ID, "owner"));
    add(key_param_long(KM_TAG_RSA_PUBLIC_EXPONENT, 65537));
    ASSERT_EQ(set_.length, 2u);
    EXPECT_EQ(std::memcmp(set_.params[0].blob.data, "owner", 5), 0);
    EXPECT_EQ(set_.params[1].long_integer, 65537u);
    // Two blocks: the array and the one byte string.
    EXPECT_EQ(extra_allocations(), 2u);
    key_param_set_release(&set_);
    EXPECT_EQ(set_.params, nullptr);
    EXPECT_EQ(extra_allocations(), 0u);
    key_param_set_release(&set_); // a second release does nothing
    key_param_set_release(nullptr);
}

TEST_F(ParamSet, ReleaseSkipsByteStringsWithoutData) {
    key_param_t p{};
    p.tag = KM_TAG_NONCE;
    p.blob.data_length = 12;
    add(p);
    add(bytes(KM_TAG_ASSOCIATED_DATA, "aad"));
    key_param_set_release(&set_);
    EXPECT_EQ(extra_allocations(), 0u);
}

TEST_F(ParamSet, FailedAddLeavesTheSetIntactAndTheDataWithTheCaller) {
    add(key_param_enum(KM_TAG_PURPOSE, KM_PURPOSE_SIGN));
    key_param_t *before = set_.params;
    key_param_t p = bytes(KM_TAG_APPLICATION_DATA, "data");
    tee_host::heap::fail_nth(1);
    EXPECT_EQ(key_param_set_add(&set_, p), TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_EQ(set_.length, 1u);
    EXPECT_EQ(set_.params, before);
    EXPECT_EQ(set_.params[0].enumerated, KM_PURPOSE_SIGN);
    ta_free(p.blob.data);
}

TEST_F(ParamSet, DumpShowsEachTypeAndNeverByteStringContents) {
    add(key_param_enum(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY));
    add(key_param_enum(KM_TAG_ALGORITHM, 0xFFFFFFFF));
    add(key_param_enum(KM_TAG_KEY_SIZE, 256));
    add(key_param_long(KM_TAG_USER_SECURE_ID, 0x1122334455667788ull));
    add(key_param_long(KM_TAG_ACTIVE_DATETIME, 0x10));
    add(key_param_bool(KM_TAG_NO_AUTH_REQUIRED));
    add(bytes(KM_TAG_APPLICATION_ID, "secret-owner"));
    key_param_t bignum{};
    bignum.tag = KM_BIGNUM | 9;
    add(bignum);
    add(key_param_enum(0xB0000001, 1));
    add(key_param_enum(0, 0));
    tee_host::trace::clear();
    keymaster_dump_key_param_set("caller.cpp", 42, &set_);

    std::vector<std::string> got;
    for (const auto &l : tee_host::trace::captured()) {
        EXPECT_EQ(l.level, TEE_TRACE_DEBUG);
        EXPECT_EQ(l.func, "keymaster_dump_key_param_set");
        EXPECT_EQ(l.formatted.find("secret-owner"), std::string::npos);
        got.push_back(l.message);
    }
    const std::vector<std::string> expected = {
        "Dump at caller.cpp:42",
        "Tag: 0x20000001",
        "    KM_ENUM: 3",
        "Tag: 0x10000002",
        "    KM_ENUM: -1",
        "Tag: 0x30000003",
        "    KM_UINT: 0x00000100",
        "Tag: 0xa00001f6",
        "    KM_ULONG: 0x1122334455667788",
        "Tag: 0x60000190",
        "    KM_DATE: 0x0000000000000010",
        "Tag: 0x700001f7",
        "    KM_BOOL: 1",
        "Tag: 0x90000259",
        "    KM_BYTES, length 12B",
        "Tag: 0x80000009",
        "    KM_BIGNUM, length 0B",
        "Tag: 0xb0000001",
        "    Invalid tag type",
        "Tag: 0x00000000",
        "    KM_INVALID",
    };
    EXPECT_EQ(got, expected);
}

} // namespace
