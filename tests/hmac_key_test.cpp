/*
 * HMAC keys: the size, digest and minimum-MAC-length rules of generation
 * and import, and the key data sealed into the blob.
 */
#include <cstring>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

class HmacKey : public KeyTest {
  protected:
    // The key data inside a blob, through a trusted TA's raw opening.
    Bytes key_data_of(const Bytes &blob) {
        uint32_t trusted = open(&trusted_client_uuids[0]);
        Bytes payload;
        EXPECT_EQ(open_raw(trusted, blob, &payload), TEE_SUCCESS);
        tee_->close_session(trusted);
        uint32_t l = km::get_u32(payload.data());
        return Bytes(payload.begin() + 4, payload.begin() + 4 + l);
    }
};

struct DigestRow {
    uint32_t digest;
    uint32_t type;
    uint32_t min_bits, max_bits, max_min_mac;
};
const DigestRow kRows[] = {
    {1, 0xA0000001, 64, 512, 128},   {2, 0xA0000002, 80, 512, 160},   {3, 0xA0000003, 112, 512, 224},
    {4, 0xA0000004, 192, 1024, 256}, {5, 0xA0000005, 256, 1024, 384}, {6, 0xA0000006, 256, 1024, 512},
};

TEST_F(HmacKey, KeySizeLimitsPerDigest) {
    for (const DigestRow &r : kRows) {
        SCOPED_TRACE(testing::Message() << "digest " << r.digest);
        Bytes blob;
        for (uint32_t bits : {r.min_bits, r.max_bits}) {
            ASSERT_TRUE(generate(hmac_params(bits, r.digest, 64), &blob).ok()) << bits << dump_log();
            Bytes kd = key_data_of(blob);
            ASSERT_EQ(kd.size(), bits / 8 + 8);
            EXPECT_EQ(km::get_u32(kd.data()), bits);
            EXPECT_EQ(km::get_u32(kd.data() + 4), r.type);
        }
        for (uint32_t bits : {r.min_bits - 8, r.max_bits + 8}) {
            tee_host::trace::clear();
            Outcome o = generate(hmac_params(bits, r.digest, 64), &blob);
            EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_KEY_SIZE) << bits;
            // Below 64 bits the general floor refuses before the digest table does.
            std::string why = bits < 64 ? "Invalid hmac key size " : "Invalid HMAC key size ";
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "hmac_generate_key", why + std::to_string(bits))) << dump_log();
        }
        ASSERT_TRUE(generate(hmac_params(r.min_bits, r.digest, r.max_min_mac), &blob).ok());
        tee_host::trace::clear();
        Outcome o = generate(hmac_params(r.min_bits, r.digest, r.max_min_mac + 8), &blob);
        EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH);
        EXPECT_TRUE(logged_message("Invalid KM_TAG_MIN_MAC_LENGTH " + std::to_string(r.max_min_mac + 8)));
    }
}

TEST_F(HmacKey, GeneratedKeysAreRandomAndLaidOut) {
    Bytes a, b;
    ASSERT_TRUE(generate(hmac_params(256, 4, 128), &a).ok());
    ASSERT_TRUE(generate(hmac_params(256, 4, 128), &b).ok());
    Bytes ka = key_data_of(a), kb = key_data_of(b);
    ASSERT_EQ(ka.size(), 40u);
    EXPECT_EQ(to_hex(Bytes(ka.begin(), ka.begin() + 8)), "00010000040000a0");
    EXPECT_NE(Bytes(ka.begin() + 8, ka.end()), Bytes(kb.begin() + 8, kb.end()));
}

TEST_F(HmacKey, GenerationRefusals) {
    struct Case {
        const char *what;
        ParamSet params;
        int32_t error;
        const char *log; // null: no error line from the provider
    };
    ParamSet no_size;
    no_size.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add(KM_TAG_DIGEST, 4).add(KM_TAG_MIN_MAC_LENGTH, 128);
    ParamSet two_sizes = hmac_params();
    two_sizes.add(KM_TAG_KEY_SIZE, 256);
    ParamSet no_min_mac;
    no_min_mac.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add(KM_TAG_DIGEST, 4).add(KM_TAG_KEY_SIZE, 256);
    ParamSet two_digests = hmac_params();
    two_digests.add(KM_TAG_DIGEST, 5);
    const Case cases[] = {
        {"no key size", no_size, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_KEY_SIZE or specified"},
        {"two key sizes", two_sizes, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_KEY_SIZE or specified"},
        {"260 bits", hmac_params(260), KM_ERROR_UNSUPPORTED_KEY_SIZE, "Invalid hmac key size 260"},
        {"56 bits", hmac_params(56, 1), KM_ERROR_UNSUPPORTED_KEY_SIZE, "Invalid hmac key size 56"},
        {"no min mac", no_min_mac, KM_ERROR_INVALID_ARGUMENT, "No or too many KM_TAG_MIN_MAC_LENGTH or specified"},
        {"min mac 60", hmac_params(256, 4, 60), KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH,
         "Invalid KM_TAG_MIN_MAC_LENGTH 60"},
        {"min mac 100", hmac_params(256, 4, 100), KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH,
         "Invalid KM_TAG_MIN_MAC_LENGTH 100"},
        {"min mac 264", hmac_params(256, 4, 264), KM_ERROR_UNSUPPORTED_MIN_MAC_LENGTH,
         "Invalid KM_TAG_MIN_MAC_LENGTH 264"},
        {"two digests", two_digests, KM_ERROR_UNSUPPORTED_DIGEST, "No or too many KM_TAG_DIGEST"},
        {"digest none", hmac_params(256, 0), KM_ERROR_UNSUPPORTED_DIGEST, nullptr},
        {"digest 7", hmac_params(256, 7), KM_ERROR_UNSUPPORTED_DIGEST, nullptr},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        tee_host::trace::clear();
        Bytes blob;
        Outcome o = generate(c.params, &blob);
        EXPECT_EQ(o.res, TEE_SUCCESS);
        EXPECT_EQ(o.error, c.error);
        if (c.log) {
            EXPECT_TRUE(logged(TEE_TRACE_ERROR, "hmac_generate_key", c.log)) << dump_log();
        } else {
            for (const auto &l : tee_host::trace::captured())
                EXPECT_NE(l.level, TEE_TRACE_ERROR) << l.formatted;
        }
    }
}

TEST_F(HmacKey, ImportRules) {
    ParamSet base;
    base.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add(KM_TAG_DIGEST, 4).add(KM_TAG_MIN_MAC_LENGTH, 128);
    Bytes blob, chars;
    Bytes seven(7, 1);
    ParamSet sha1 = base;
    tee_host::trace::clear();
    Outcome o = import(sha1, seven, &blob);
    EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "hmac_import_key", "Invalid hmac key size 56"));

    // 23 bytes is a valid length but too short for SHA-256.
    tee_host::trace::clear();
    o = import(base, Bytes(23, 1), &blob);
    EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_KEY_SIZE);
    EXPECT_TRUE(logged_message("Invalid HMAC key size 184"));

    ParamSet origin = base;
    origin.add(KM_TAG_ORIGIN, KM_ORIGIN_IMPORTED);
    tee_host::trace::clear();
    o = import(origin, Bytes(32, 1), &blob);
    EXPECT_EQ(o.error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "hmac_import_key", "Shouldn't specify KM_TAG_ORIGIN"));

    Bytes material(64);
    for (size_t i = 0; i < material.size(); ++i)
        material[i] = static_cast<uint8_t>(255 - i);
    ASSERT_TRUE(import(base, material, &blob, &chars).ok());
    Bytes kd = key_data_of(blob);
    ASSERT_EQ(kd.size(), 72u);
    EXPECT_EQ(km::get_u32(kd.data()), 512u);
    EXPECT_EQ(km::get_u32(kd.data() + 4), 0xA0000004u);
    EXPECT_EQ(Bytes(kd.begin() + 8, kd.end()), material);
}

} // namespace
