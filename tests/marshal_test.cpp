/*
 * Serialized parameter sets: the byte layout, hidden parameters, every
 * truncation, oversized counts and lengths, and allocation failures.
 */
#include <cstring>

#include "keymaster_defs.h"
#include "marshal.h"
#include "ta_fixture.h"

namespace {

// ALGORITHM = HMAC and ASSOCIATED_DATA = "abc", 55 bytes.
const Bytes kWorkedExample = hex("02000000"
                                 "02000010 00000000 80000000 000000000000000000000000"
                                 "e8030090 00000000 00000000 00000000 03000000 00000000"
                                 "616263");

class Marshal : public TaTest {
  protected:
    void TearDown() override {
        key_param_set_release(&set_);
        TaTest::TearDown();
    }
    void add_bytes(uint32_t tag, const Bytes &data) {
        key_param_t p{};
        p.tag = tag;
        p.blob.data_length = static_cast<uint32_t>(data.size());
        p.blob.data = static_cast<uint8_t *>(ta_malloc(p.blob.data_length));
        if (!data.empty())
            std::memcpy(p.blob.data, data.data(), data.size());
        ASSERT_EQ(key_param_set_add(&set_, p), TEE_SUCCESS);
    }
    void build_example(uint32_t second_tag) {
        ASSERT_EQ(key_param_set_add(&set_, key_param_enum(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)), TEE_SUCCESS);
        add_bytes(second_tag, {'a', 'b', 'c'});
    }
    // marshal into a fresh allocation, returned as bytes.
    Bytes to_bytes(bool include_hidden) {
        uint8_t *buf = nullptr;
        uint32_t len = 0;
        EXPECT_EQ(marshal(&set_, include_hidden, &buf, &len), TEE_SUCCESS);
        Bytes out(buf, buf + len);
        ta_free(buf);
        return out;
    }
    keymaster_key_param_set_t set_{};
};

TEST_F(Marshal, WorkedExampleByteForByte) {
    build_example(KM_TAG_ASSOCIATED_DATA);
    EXPECT_EQ(marshal_size(&set_, false), 55u);
    EXPECT_EQ(to_hex(to_bytes(false)), to_hex(kWorkedExample));

    keymaster_key_param_set_t back{};
    ASSERT_EQ(unmarshal(kWorkedExample.data(), 55, &back), TEE_SUCCESS);
    ASSERT_EQ(back.length, 2u);
    EXPECT_EQ(back.params[0].tag, KM_TAG_ALGORITHM);
    EXPECT_EQ(back.params[0].enumerated, KM_ALGORITHM_HMAC);
    EXPECT_EQ(back.params[1].tag, KM_TAG_ASSOCIATED_DATA);
    ASSERT_EQ(back.params[1].blob.data_length, 3u);
    EXPECT_EQ(std::memcmp(back.params[1].blob.data, "abc", 3), 0);
    key_param_set_release(&back);
}

TEST_F(Marshal, HiddenParametersOnlyWhenAskedFor) {
    build_example(KM_TAG_APPLICATION_DATA);
    add_bytes(KM_TAG_APPLICATION_ID, {1, 2});
    add_bytes(KM_TAG_ROOT_OF_TRUST, {3});
    EXPECT_EQ(marshal_size(&set_, false), 28u);
    Bytes visible = to_bytes(false);
    EXPECT_EQ(to_hex(visible), to_hex(Bytes(kWorkedExample.begin(), kWorkedExample.begin() + 28)).replace(0, 2, "01"));

    Bytes all = to_bytes(true);
    EXPECT_EQ(all.size(), 4u + 4 * 24 + 3 + 2 + 1);
    EXPECT_EQ(all[0], 4);
    Bytes expected = kWorkedExample;
    expected[0] = 4;
    expected[28] = 0xBC; // APPLICATION_DATA is 0x900002BC
    expected[29] = 0x02;
    EXPECT_EQ(to_hex(Bytes(all.begin(), all.begin() + 55)), to_hex(expected));
}

TEST_F(Marshal, EmptySetsAndSetsOfOnlyHiddenParameters) {
    EXPECT_EQ(to_bytes(false), hex("00000000"));
    keymaster_key_param_set_t back{};
    ASSERT_EQ(unmarshal(hex("00000000").data(), 4, &back), TEE_SUCCESS);
    EXPECT_EQ(back.length, 0u);
    key_param_set_release(&back);

    add_bytes(KM_TAG_APPLICATION_ID, {9, 9, 9});
    EXPECT_EQ(to_bytes(false), hex("00000000"));
}

TEST_F(Marshal, EmptyByteStrings) {
    add_bytes(KM_TAG_NONCE, {});
    Bytes out = to_bytes(false);
    EXPECT_EQ(out.size(), 28u);

    set_.params[0].blob.data_length = 0;
    ta_free(set_.params[0].blob.data);
    set_.params[0].blob.data = nullptr;
    uint8_t *buf = nullptr;
    uint32_t len = 77;
    tee_host::trace::clear();
    EXPECT_EQ(marshal(&set_, false, &buf, &len), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "marshal", "Invalid keymaster_key_param_set_t"));
    EXPECT_EQ(buf, nullptr);
    EXPECT_EQ(len, 0u);
}

TEST_F(Marshal, CallerBufferExactAndOneByteShort) {
    build_example(KM_TAG_ASSOCIATED_DATA);
    Bytes out(55, 0xEE);
    uint8_t *buf = out.data();
    uint32_t len = 55;
    ASSERT_EQ(marshal(&set_, false, &buf, &len), TEE_SUCCESS);
    EXPECT_EQ(len, 55u);
    EXPECT_EQ(out, kWorkedExample);

    Bytes small(54, 0xEE);
    buf = small.data();
    len = 54;
    tee_host::trace::clear();
    EXPECT_EQ(marshal(&set_, false, &buf, &len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "marshal", "Too short marshalling buffer"));
    EXPECT_EQ(buf, nullptr);
    EXPECT_EQ(len, 0u);
    EXPECT_EQ(small, Bytes(54, 0xEE));
}

TEST_F(Marshal, EveryTruncationIsRefusedAndLeavesTheSetEmpty) {
    for (uint32_t n = 0; n < kWorkedExample.size(); ++n) {
        tee_host::trace::clear();
        keymaster_key_param_set_t back{};
        EXPECT_EQ(unmarshal(kWorkedExample.data(), n, &back), TEE_ERROR_GENERIC) << n;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "unmarshal", "Too short input")) << n;
        EXPECT_EQ(back.params, nullptr);
        EXPECT_EQ(back.length, 0u);
        EXPECT_EQ(extra_allocations(), 0u) << n;
    }
}

TEST_F(Marshal, TrailingBytesAreIgnored) {
    Bytes longer = kWorkedExample;
    longer.insert(longer.end(), {1, 2, 3, 4, 5, 6, 7});
    keymaster_key_param_set_t back{};
    ASSERT_EQ(unmarshal(longer.data(), static_cast<uint32_t>(longer.size()), &back), TEE_SUCCESS);
    EXPECT_EQ(back.length, 2u);
    key_param_set_release(&back);
}

TEST_F(Marshal, UnusedBytesSurviveARoundTrip) {
    // UINT with bytes 4..7 and 12..23 set; BYTES with its unused tail (20..23)
    // set and garbage in the pointer slot; an unknown type carried whole.
    Bytes in = hex("03000000"
                   "08000030 a1a2a3a4 40000000 b1b2b3b4 c1c2c3c4 d1d2d3d4"
                   "e8030090 e1e2e3e4 ffffffff ffffffff 02000000 f1f2f3f4"
                   "7a7b"
                   "010000b0 01020304 05060708 090a0b0c 0d0e0f10 11121314");
    keymaster_key_param_set_t back{};
    ASSERT_EQ(unmarshal(in.data(), static_cast<uint32_t>(in.size()), &back), TEE_SUCCESS);
    ASSERT_EQ(back.length, 3u);
    EXPECT_EQ(back.params[0].integer, 0x40u);
    set_ = back;
    Bytes out = to_bytes(false);
    Bytes expected = in;
    // Only the pointer slot changes: it goes out as zero.
    std::memset(expected.data() + 4 + 24 + 8, 0, sizeof(void *));
    EXPECT_EQ(to_hex(out), to_hex(expected));
}

TEST_F(Marshal, RecordsKeepTheirOrderAndRepeats) {
    ASSERT_EQ(key_param_set_add(&set_, key_param_enum(KM_TAG_DIGEST, 4)), TEE_SUCCESS);
    add_bytes(KM_TAG_NONCE, {1});
    ASSERT_EQ(key_param_set_add(&set_, key_param_enum(KM_TAG_DIGEST, 4)), TEE_SUCCESS);
    Bytes out = to_bytes(true);
    keymaster_key_param_set_t back{};
    ASSERT_EQ(unmarshal(out.data(), static_cast<uint32_t>(out.size()), &back), TEE_SUCCESS);
    ASSERT_EQ(back.length, 3u);
    EXPECT_EQ(back.params[0].tag, KM_TAG_DIGEST);
    EXPECT_EQ(back.params[1].tag, KM_TAG_NONCE);
    EXPECT_EQ(back.params[2].tag, KM_TAG_DIGEST);
    key_param_set_release(&back);
}

TEST_F(Marshal, OversizedCountsAndLengths) {
    // A count whose array would not fit in 32 bits is refused before allocating.
    for (uint32_t count : {178956971u, 0xFFFFFFFFu}) {
        Bytes in = hex("00000000");
        std::memcpy(in.data(), &count, 4);
        uint64_t attempts = tee_host::heap::stats().allocations;
        tee_host::trace::clear();
        keymaster_key_param_set_t back{};
        EXPECT_EQ(unmarshal(in.data(), 4, &back), TEE_ERROR_OUT_OF_MEMORY);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "unmarshal", "Out of memory"));
        EXPECT_EQ(tee_host::heap::stats().allocations, attempts);
        EXPECT_EQ(back.params, nullptr);
    }
    // The largest count that fits is tried and fails on the TA heap.
    {
        Bytes in = hex("aaaaaa0a");
        keymaster_key_param_set_t back{};
        EXPECT_EQ(unmarshal(in.data(), 4, &back), TEE_ERROR_OUT_OF_MEMORY);
    }
    // A byte-string length too large to allocate fails before the input runs out.
    {
        Bytes in = hex("01000000 e8030090 00000000 00000000 00000000 00001000 00000000");
        tee_host::trace::clear();
        keymaster_key_param_set_t back{};
        EXPECT_EQ(unmarshal(in.data(), static_cast<uint32_t>(in.size()), &back), TEE_ERROR_OUT_OF_MEMORY);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "unmarshal", "Out of memory, require 1048576B")) << dump_log();
    }
    // A length that can be allocated but is not there is a short input.
    {
        Bytes in = hex("01000000 e8030090 00000000 00000000 00000000 00010000 00000000 0102");
        tee_host::trace::clear();
        keymaster_key_param_set_t back{};
        EXPECT_EQ(unmarshal(in.data(), static_cast<uint32_t>(in.size()), &back), TEE_ERROR_GENERIC);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "unmarshal", "Too short input"));
    }
    EXPECT_EQ(unmarshal(kWorkedExample.data(), 55, nullptr), TEE_ERROR_SHORT_BUFFER);
}

TEST_F(Marshal, MarshalAllocationFailure) {
    build_example(KM_TAG_ASSOCIATED_DATA);
    int points = sweep_allocations("marshal", nullptr,
                                   [&] {
                                       uint8_t *buf = nullptr;
                                       uint32_t len = 1;
                                       TEE_Result res = marshal(&set_, false, &buf, &len);
                                       if (res == TEE_SUCCESS) {
                                           ta_free(buf);
                                       } else {
                                           EXPECT_EQ(buf, nullptr);
                                           EXPECT_EQ(len, 0u);
                                           EXPECT_TRUE(logged_message("Out of memory, need 55B"));
                                       }
                                       return Outcome{res, 0};
                                   },
                                   {{TEE_ERROR_OUT_OF_MEMORY, 0}});
    EXPECT_EQ(points, 1);
    EXPECT_EQ(extra_allocations(), 2u); // the set's own array and data
}

TEST_F(Marshal, UnmarshalAllocationFailures) {
    Bytes in = hex("03000000"
                   "e8030090 00000000 00000000 00000000 02000000 00000000 6162"
                   "02000010 00000000 80000000 000000000000000000000000"
                   "e9030090 00000000 00000000 00000000 01000000 00000000 63");
    int n = 0;
    int points = sweep_allocations(
        "unmarshal", [&] { tee_host::trace::clear(); },
        [&] {
            ++n;
            keymaster_key_param_set_t back{};
            TEE_Result res = unmarshal(in.data(), static_cast<uint32_t>(in.size()), &back);
            if (res == TEE_SUCCESS) {
                key_param_set_release(&back);
                return Outcome{res, 0};
            }
            EXPECT_EQ(back.params, nullptr);
            const char *expected =
                n == 1 ? "Out of memory" : (n == 2 ? "Out of memory, require 2B" : "Out of memory, require 1B");
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "unmarshal", expected)) << n << "\n" << dump_log();
            return Outcome{res, 0};
        },
        {{TEE_ERROR_OUT_OF_MEMORY, 0}});
    EXPECT_EQ(points, 3); // the array and the two byte strings
}

} // namespace
