/*
 * The normal-world client library: the name tables, and the typed
 * client's wire shapes over a scripted transport and over the embedded TEE.
 */
#include <cctype>
#include <cstdlib>
#include <deque>
#include <filesystem>
#include <set>

#include <gtest/gtest.h>

#include "keymaster_defs.h"
#include "km/client.h"
#include "km/embedded_tee.h"
#include "km/names.h"
#include "ta_entry.h"
#include "ta_fixture.h"
#include "scratch_dir.h"

namespace {

using km::Enumeration;

bool lower_identifier(std::string_view s) {
    if (s.empty())
        return false;
    for (char c : s)
        if (!(std::islower(static_cast<unsigned char>(c)) || std::isdigit(static_cast<unsigned char>(c)) || c == '_'))
            return false;
    return true;
}

std::string upper(std::string_view s) {
    std::string u(s);
    for (char &c : u)
        c = static_cast<char>(std::toupper(static_cast<unsigned char>(c)));
    return u;
}

// ---- enumerations ----

TEST(EnumNames, EveryNameRoundTripsInAnyCase) {
    for (Enumeration e : km::enumerations()) {
        SCOPED_TRACE(std::string(km::enumeration_label(e)));
        ASSERT_FALSE(km::enum_names(e).empty());
        std::set<uint32_t> values;
        std::set<std::string_view> names;
        for (const km::EnumName &n : km::enum_names(e)) {
            EXPECT_TRUE(lower_identifier(n.name)) << n.name;
            EXPECT_TRUE(values.insert(n.value).second) << "value " << n.value << " named twice";
            EXPECT_TRUE(names.insert(n.name).second) << n.name << " used twice";
            EXPECT_EQ(km::enum_name(e, n.value), n.name);
            EXPECT_EQ(km::parse_enum(e, n.name), n.value) << n.name;
            EXPECT_EQ(km::parse_enum(e, upper(n.name)), n.value) << n.name;
        }
    }
}

TEST(EnumNames, CanonicalNamesMatchTheTaValues) {
    struct Case {
        Enumeration e;
        const char *name;
        uint32_t value;
    };
    const Case cases[] = {
        {Enumeration::algorithm, "rsa", KM_ALGORITHM_RSA},
        {Enumeration::algorithm, "ec", KM_ALGORITHM_EC},
        {Enumeration::algorithm, "aes", KM_ALGORITHM_AES},
        {Enumeration::algorithm, "hmac", KM_ALGORITHM_HMAC},
        {Enumeration::purpose, "encrypt", KM_PURPOSE_ENCRYPT},
        {Enumeration::purpose, "verify", KM_PURPOSE_VERIFY},
        {Enumeration::block_mode, "ecb", KM_MODE_ECB},
        {Enumeration::block_mode, "gcm", KM_MODE_GCM},
        {Enumeration::padding, "none", KM_PAD_NONE},
        {Enumeration::padding, "rsa_oaep", KM_PAD_RSA_OAEP},
        {Enumeration::padding, "rsa_pss", KM_PAD_RSA_PSS},
        {Enumeration::padding, "rsa_pkcs1_1_5_encrypt", KM_PAD_RSA_PKCS1_1_5_ENCRYPT},
        {Enumeration::padding, "rsa_pkcs1_1_5_sign", KM_PAD_RSA_PKCS1_1_5_SIGN},
        {Enumeration::padding, "pkcs7", KM_PAD_PKCS7},
        {Enumeration::digest, "none", KM_DIGEST_NONE},
        {Enumeration::digest, "sha1", KM_DIGEST_SHA1},
        {Enumeration::digest, "sha_2_256", KM_DIGEST_SHA_2_256},
        {Enumeration::digest, "sha_2_512", KM_DIGEST_SHA_2_512},
        {Enumeration::key_format, "x509", KM_KEY_FORMAT_X509},
        {Enumeration::key_format, "pkcs8", KM_KEY_FORMAT_PKCS8},
        {Enumeration::key_format, "raw", KM_KEY_FORMAT_RAW},
        {Enumeration::key_origin, "generated", KM_ORIGIN_GENERATED},
        {Enumeration::key_origin, "imported", KM_ORIGIN_IMPORTED},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(km::enum_name(c.e, c.value), c.name);
        EXPECT_EQ(km::parse_enum(c.e, c.name), c.value) << c.name;
    }
    EXPECT_EQ(km::enum_names(Enumeration::digest).size(), 7u);
    EXPECT_EQ(km::enum_names(Enumeration::padding).size(), 6u);
}

TEST(EnumNames, AliasesAreUnambiguous) {
    for (Enumeration e : km::enumerations()) {
        SCOPED_TRACE(std::string(km::enumeration_label(e)));
        std::set<std::string_view> seen;
        for (const km::EnumName &n : km::enum_names(e))
            seen.insert(n.name);
        for (const km::EnumAlias &a : km::enum_aliases(e)) {
            EXPECT_TRUE(lower_identifier(a.alias)) << a.alias;
            EXPECT_TRUE(seen.insert(a.alias).second) << a.alias << " shadows a name or another alias";
            EXPECT_EQ(km::parse_enum(e, a.alias), a.value) << a.alias;
            // An alias never prints: output stays canonical.
            EXPECT_NE(km::enum_name(e, a.value), a.alias);
        }
    }
}

TEST(EnumNames, CommonShortFormsAreAccepted) {
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "pss"), KM_PAD_RSA_PSS);
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "OAEP"), KM_PAD_RSA_OAEP);
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "pkcs1-sign"), KM_PAD_RSA_PKCS1_1_5_SIGN);
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "pkcs1_encrypt"), KM_PAD_RSA_PKCS1_1_5_ENCRYPT);
    EXPECT_EQ(km::parse_enum(Enumeration::digest, "sha256"), KM_DIGEST_SHA_2_256);
    EXPECT_EQ(km::parse_enum(Enumeration::digest, "SHA-384"), KM_DIGEST_SHA_2_384);
    EXPECT_EQ(km::parse_enum(Enumeration::digest, "sha-1"), KM_DIGEST_SHA1);
    EXPECT_EQ(km::parse_enum(Enumeration::digest, "sha-2-224"), KM_DIGEST_SHA_2_224);
    EXPECT_EQ(km::parse_enum(Enumeration::key_format, "spki"), KM_KEY_FORMAT_X509);
    // PKCS#1 v1.5 names two paddings; a bare "pkcs1" must not pick one.
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "pkcs1"), std::nullopt);
}

TEST(EnumNames, NamesBelongToTheirOwnEnumeration) {
    EXPECT_EQ(km::parse_enum(Enumeration::block_mode, "rsa"), std::nullopt);
    EXPECT_EQ(km::parse_enum(Enumeration::algorithm, "gcm"), std::nullopt);
    EXPECT_EQ(km::parse_enum(Enumeration::digest, "pss"), std::nullopt);
    EXPECT_EQ(km::parse_enum(Enumeration::padding, "sha256"), std::nullopt);
    EXPECT_EQ(km::parse_enum(Enumeration::none, "rsa"), std::nullopt);
    EXPECT_TRUE(km::enum_names(Enumeration::none).empty());
}

TEST(EnumNames, UnknownValuesPrintAndParseAsNumbers) {
    EXPECT_EQ(km::enum_name(Enumeration::algorithm, 2), "2");
    EXPECT_EQ(km::enum_name(Enumeration::digest, 4294967295u), "4294967295");
    EXPECT_EQ(km::parse_enum(Enumeration::algorithm, "2"), 2u);
    EXPECT_EQ(km::parse_enum(Enumeration::algorithm, "0x20"), KM_ALGORITHM_AES);
    EXPECT_EQ(km::parse_enum(Enumeration::none, "4294967295"), 4294967295u);
    for (const char *bad : {"", "bogus", "4294967296", "-1", "+1", "0x", "12a", " rsa", "rsa "})
        EXPECT_EQ(km::parse_enum(Enumeration::algorithm, bad), std::nullopt) << '"' << bad << '"';
}

TEST(EnumNames, ParseNumberBounds) {
    EXPECT_EQ(km::parse_number("0"), 0u);
    EXPECT_EQ(km::parse_number("18446744073709551615"), UINT64_MAX);
    EXPECT_EQ(km::parse_number("0xFFFFFFFFFFFFFFFF"), UINT64_MAX);
    EXPECT_EQ(km::parse_number("18446744073709551616"), std::nullopt);
    EXPECT_EQ(km::parse_number("0x10000000000000000"), std::nullopt);
    EXPECT_EQ(km::parse_number("ff"), std::nullopt);
    EXPECT_EQ(km::parse_number("0xg"), std::nullopt);
}

// ---- tags ----

TEST(TagNames, EveryTagRoundTripsWithAndWithoutPrefix) {
    std::set<uint32_t> values;
    for (const km::TagInfo &t : km::tags()) {
        SCOPED_TRACE(std::string(t.name));
        ASSERT_EQ(t.name.substr(0, 7), "KM_TAG_");
        EXPECT_TRUE(values.insert(t.tag).second);
        EXPECT_EQ(km::tag_name(t.tag), t.name);
        EXPECT_EQ(km::find_tag(t.tag), &t);
        std::string bare(t.name.substr(7));
        std::string lower_bare;
        for (char c : bare)
            lower_bare += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
        EXPECT_EQ(km::parse_tag(t.name), &t);
        EXPECT_EQ(km::parse_tag(bare), &t);
        EXPECT_EQ(km::parse_tag(lower_bare), &t);
        EXPECT_EQ(km::parse_tag("km_tag_" + lower_bare), &t);
        EXPECT_NE(km::tag_type_label(km::tag_type(t.tag)), "unknown");
        EXPECT_NE(km::tag_type(t.tag), uint32_t{KM_INVALID});
    }
}

TEST(TagNames, KnownTagsIncludingSoter) {
    EXPECT_EQ(km::tag_name(KM_TAG_PURPOSE), "KM_TAG_PURPOSE");
    EXPECT_EQ(km::tag_name(0x20000001u), "KM_TAG_PURPOSE");
    ASSERT_NE(km::parse_tag("purpose"), nullptr);
    EXPECT_EQ(km::parse_tag("purpose")->tag, 0x20000001u);
    ASSERT_NE(km::parse_tag("key-size"), nullptr);
    EXPECT_EQ(km::parse_tag("key-size")->tag, uint32_t{KM_TAG_KEY_SIZE});
    for (uint32_t soter :
         {KM_TAG_SOTER_IS_FROM_SOTER, KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY,
          KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_COMMON_KEY_WHEN_GET_PUBLIC_KEY,
          KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY, KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY,
          KM_TAG_SOTER_UID, KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY_BLOB})
        EXPECT_NE(km::find_tag(soter), nullptr) << std::hex << soter;
    EXPECT_EQ(km::tag_name(KM_TAG_SOTER_UID), "KM_TAG_SOTER_UID");
    ASSERT_NE(km::parse_tag("soter_uid"), nullptr);
    EXPECT_EQ(km::parse_tag("soter_uid")->tag, uint32_t{KM_TAG_SOTER_UID});
}

TEST(TagNames, UnknownTags) {
    EXPECT_EQ(km::find_tag(KM_UINT | 9999), nullptr);
    EXPECT_EQ(km::tag_name(KM_UINT | 9999), "0x3000270f");
    EXPECT_EQ(km::tag_name(KM_TAG_INVALID), "0x00000000");
    for (const char *bad : {"", "KM_TAG_", "bogus", "KM_TAG_PURPOSES", "tag_purpose", "purpose=1"})
        EXPECT_EQ(km::parse_tag(bad), nullptr) << bad;
}

TEST(TagNames, TypesComeFromTheTopBits) {
    struct Case {
        uint32_t tag;
        const char *label;
        bool repeatable;
    };
    const Case cases[] = {
        {KM_TAG_PURPOSE, "enum_rep", true},
        {KM_TAG_ALGORITHM, "enum", false},
        {KM_TAG_KEY_SIZE, "uint", false},
        {KM_TAG_RSA_PUBLIC_EXPONENT, "ulong", false},
        {KM_TAG_ACTIVE_DATETIME, "date", false},
        {KM_TAG_CALLER_NONCE, "bool", false},
        {KM_TAG_NONCE, "bytes", false},
        {KM_TAG_USER_SECURE_ID, "ulong_rep", true},
        {KM_TAG_SOTER_UID, "uint", false},
        {KM_TAG_SOTER_AUTO_SIGNED_COMMON_KEY_WHEN_GET_PUBLIC_KEY, "bytes", false},
    };
    for (const Case &c : cases) {
        EXPECT_EQ(km::tag_type_label(km::tag_type(c.tag)), c.label) << km::tag_name(c.tag);
        EXPECT_EQ(km::tag_repeatable(c.tag), c.repeatable) << km::tag_name(c.tag);
    }
    EXPECT_EQ(km::tag_type_label(KM_BIGNUM), "bignum");
    EXPECT_EQ(km::tag_type_label(KM_UINT_REP), "uint_rep");
    EXPECT_EQ(km::tag_type_label(0xB0000000u), "unknown");
    EXPECT_TRUE(km::tag_repeatable(KM_UINT_REP | 1));
}

TEST(TagNames, EnumeratedTagsNameTheirValues) {
    struct Case {
        uint32_t tag;
        Enumeration values;
    };
    const Case cases[] = {
        {KM_TAG_PURPOSE, Enumeration::purpose},       {KM_TAG_ALGORITHM, Enumeration::algorithm},
        {KM_TAG_BLOCK_MODE, Enumeration::block_mode}, {KM_TAG_DIGEST, Enumeration::digest},
        {KM_TAG_PADDING, Enumeration::padding},       {KM_TAG_ORIGIN, Enumeration::key_origin},
    };
    for (const Case &c : cases) {
        ASSERT_NE(km::find_tag(c.tag), nullptr);
        EXPECT_EQ(km::find_tag(c.tag)->values, c.values) << km::tag_name(c.tag);
    }
    // Only enumerated tags carry names, and no enumeration sits on a tag of another type.
    for (const km::TagInfo &t : km::tags()) {
        uint32_t type = km::tag_type(t.tag);
        if (t.values != Enumeration::none) {
            EXPECT_TRUE(type == KM_ENUM || type == KM_ENUM_REP) << t.name;
        }
    }
    EXPECT_EQ(km::find_tag(KM_TAG_KEY_SIZE)->values, Enumeration::none);
}

// ---- errors and TEE results ----

TEST(ErrorNames, EveryErrorRoundTripsWithASentence) {
    std::set<int32_t> codes;
    std::set<std::string_view> messages;
    for (const km::ErrorInfo &e : km::errors()) {
        SCOPED_TRACE(std::string(e.name));
        ASSERT_EQ(e.name.substr(0, 9), "KM_ERROR_");
        EXPECT_TRUE(codes.insert(e.code).second);
        EXPECT_TRUE(messages.insert(e.message).second) << "message reused: " << e.message;
        EXPECT_EQ(km::error_name(e.code), e.name);
        EXPECT_EQ(km::error_message(e.code), e.message);
        EXPECT_EQ(km::parse_error(e.name), e.code);
        EXPECT_EQ(km::parse_error(std::to_string(e.code)), e.code);
        ASSERT_GE(e.message.size(), 2u);
        EXPECT_TRUE(std::isupper(static_cast<unsigned char>(e.message.front())));
        EXPECT_EQ(e.message.back(), '.');
        EXPECT_EQ(e.message.find('.'), e.message.size() - 1) << "one sentence";
    }
    EXPECT_EQ(km::errors().front().code, 0);
    EXPECT_TRUE(codes.count(KM_ERROR_UNKNOWN_ERROR));
    EXPECT_TRUE(codes.count(KM_ERROR_VERSION_MISMATCH));
}

TEST(ErrorNames, KnownAndUnknownCodes) {
    EXPECT_EQ(km::error_name(-13), "KM_ERROR_INCOMPATIBLE_DIGEST");
    EXPECT_EQ(km::parse_error("KM_ERROR_INCOMPATIBLE_DIGEST"), -13);
    EXPECT_EQ(km::parse_error("incompatible-digest"), -13);
    EXPECT_EQ(km::parse_error("-2"), KM_ERROR_UNSUPPORTED_PURPOSE);
    EXPECT_EQ(km::error_name(-42), "-42"); // a gap in the numbering
    EXPECT_EQ(km::find_error(-42), nullptr);
    EXPECT_FALSE(km::error_message(-42).empty());
    EXPECT_EQ(km::error_name(INT32_MIN), "-2147483648");
    EXPECT_EQ(km::parse_error("-2147483648"), INT32_MIN);
    for (const char *bad : {"", "-", "--1", "0x10", "-0x10", "2147483648", "-2147483649", "KM_ERROR_", "bogus"})
        EXPECT_EQ(km::parse_error(bad), std::nullopt) << bad;
}

TEST(TeeResultNames, RoundTripAndUnknown) {
    std::set<uint32_t> results;
    for (const km::TeeResultName &r : km::tee_results()) {
        EXPECT_TRUE(results.insert(r.result).second) << r.name;
        EXPECT_EQ(km::tee_result_name(r.result), r.name);
        EXPECT_EQ(km::parse_tee_result(r.name), r.result);
    }
    EXPECT_EQ(km::tee_result_name(TEE_SUCCESS), "TEE_SUCCESS");
    EXPECT_EQ(km::tee_result_name(0xFFFF0006u), "TEE_ERROR_BAD_PARAMETERS");
    EXPECT_EQ(km::tee_result_name(TEE_ERROR_SIGNATURE_INVALID), "TEE_ERROR_SIGNATURE_INVALID");
    EXPECT_EQ(km::parse_tee_result("tee_error_short_buffer"), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(km::tee_result_name(0x12345678u), "0x12345678");
    EXPECT_EQ(km::parse_tee_result("0x12345678"), 0x12345678u);
    EXPECT_EQ(km::parse_tee_result("TEE_ERROR_NOPE"), std::nullopt);
}

// ---- the typed client over a scripted transport ----

// Answers each invoke from a script and records what the client sent.
class ScriptedTransport : public km::Transport {
  public:
    struct Sent {
        uint32_t cmd;
        uint32_t types;
        uint32_t a;
        uint32_t b;
        uint32_t out_size; // params[2].memref.size, when a memref was sent
    };
    struct Answer {
        TEE_Result res = TEE_SUCCESS;
        uint32_t a = 0;
        uint32_t b = 0;
        Bytes out;                        // written into params[2]
        std::optional<uint32_t> out_size; // what params[2].memref.size becomes
    };

    TEE_Result open() override { return TEE_SUCCESS; }
    void close() override {}
    TEE_Result invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) override {
        bool memref = TEE_PARAM_TYPE_GET(types, 2) == TEE_PARAM_TYPE_MEMREF_OUTPUT;
        sent.push_back({cmd, types, params[0].value.a, params[0].value.b, memref ? params[2].memref.size : 0});
        if (answers.empty()) {
            ADD_FAILURE() << "unexpected command " << cmd;
            return TEE_ERROR_GENERIC;
        }
        Answer ans = answers.front();
        answers.pop_front();
        params[0].value.a = ans.a;
        params[0].value.b = ans.b;
        if (memref) {
            EXPECT_LE(ans.out.size(), params[2].memref.size);
            std::copy(ans.out.begin(), ans.out.end(), static_cast<uint8_t *>(params[2].memref.buffer));
            if (ans.out_size)
                params[2].memref.size = *ans.out_size;
        }
        return ans.res;
    }

    std::deque<Answer> answers;
    std::vector<Sent> sent;
};

constexpr uint32_t kValue = 0x0003;
constexpr uint32_t kValueOut = 0x0603;

TEST(ClientWire, AlgorithmsCountThenListOfExactlySixteenBytes) {
    ScriptedTransport t;
    t.answers = {{TEE_SUCCESS, 4, 0, {}, {}}, {TEE_SUCCESS, 0, 0, hex("01000000 20000000 03000000 80000000"), {}}};
    km::Client client(t);
    km::Result<km::ValueList> r = client.algorithms();
    ASSERT_TRUE(r.ok()) << km::describe(r.status);
    EXPECT_EQ(r.value, (km::ValueList{1, 32, 3, 128}));
    ASSERT_EQ(t.sent.size(), 2u);
    EXPECT_EQ(t.sent[0].cmd, 1u);
    EXPECT_EQ(t.sent[0].types, kValue);
    EXPECT_EQ(t.sent[0].a, 0u);
    EXPECT_EQ(t.sent[0].b, 0u);
    EXPECT_EQ(t.sent[1].cmd, 2u);
    EXPECT_EQ(t.sent[1].types, kValueOut);
    EXPECT_EQ(t.sent[1].a, 0u);
    EXPECT_EQ(t.sent[1].b, 0u);
    EXPECT_EQ(t.sent[1].out_size, 16u);
}

TEST(ClientWire, EachQueryUsesItsCommandPairAndArguments) {
    struct Case {
        const char *what;
        uint32_t count_cmd;
        uint32_t purpose_sent;
        km::Result<km::ValueList> (*call)(km::Client &);
    };
    const Case cases[] = {
        {"block modes", 3, KM_PURPOSE_DECRYPT, [](km::Client &c) { return c.block_modes(7, KM_PURPOSE_DECRYPT); }},
        {"paddings", 5, KM_PURPOSE_SIGN, [](km::Client &c) { return c.paddings(7, KM_PURPOSE_SIGN); }},
        {"digests", 7, KM_PURPOSE_VERIFY, [](km::Client &c) { return c.digests(7, KM_PURPOSE_VERIFY); }},
        {"import formats", 9, 0, [](km::Client &c) { return c.import_formats(7); }},
        {"export formats", 11, 0, [](km::Client &c) { return c.export_formats(7); }},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        ScriptedTransport t;
        // a = error, b = count; then the list of three values.
        t.answers = {{TEE_SUCCESS, 0, 3, {}, {}}, {TEE_SUCCESS, 0, 0, hex("05000000 40000000 ffffffff"), {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = c.call(client);
        ASSERT_TRUE(r.ok()) << km::describe(r.status);
        EXPECT_EQ(r.value, (km::ValueList{5, 64, 0xFFFFFFFFu}));
        ASSERT_EQ(t.sent.size(), 2u);
        EXPECT_EQ(t.sent[0].cmd, c.count_cmd);
        EXPECT_EQ(t.sent[0].types, kValue);
        EXPECT_EQ(t.sent[0].a, 7u);
        EXPECT_EQ(t.sent[0].b, c.purpose_sent);
        EXPECT_EQ(t.sent[1].cmd, c.count_cmd + 1);
        EXPECT_EQ(t.sent[1].types, kValueOut);
        EXPECT_EQ(t.sent[1].a, 7u);
        EXPECT_EQ(t.sent[1].b, c.purpose_sent);
        EXPECT_EQ(t.sent[1].out_size, 12u);
    }
}

TEST(ClientWire, RefusalsAndFailuresAreToldApart) {
    {
        SCOPED_TRACE("refused at the count step: no list command follows");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_UNSUPPORTED_PURPOSE), 0, {}, {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = client.block_modes(KM_ALGORITHM_HMAC, KM_PURPOSE_ENCRYPT);
        EXPECT_TRUE(r.status.refused());
        EXPECT_FALSE(r.status.tee_failed());
        EXPECT_EQ(r.status.km, KM_ERROR_UNSUPPORTED_PURPOSE);
        EXPECT_EQ(t.sent.size(), 1u);
        EXPECT_EQ(km::describe(r.status),
                  "KM_ERROR_UNSUPPORTED_PURPOSE (-2): The algorithm does not support this purpose.");
    }
    {
        SCOPED_TRACE("refused at the list step");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, 0, 2, {}, {}},
                     {TEE_SUCCESS, static_cast<uint32_t>(KM_ERROR_UNSUPPORTED_ALGORITHM), 0, {}, {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = client.import_formats(1);
        EXPECT_TRUE(r.status.refused());
        EXPECT_EQ(r.status.km, KM_ERROR_UNSUPPORTED_ALGORITHM);
        EXPECT_TRUE(r.value.empty());
    }
    {
        SCOPED_TRACE("TEE failure: whatever params[0] holds is not a Keymaster error");
        ScriptedTransport t;
        t.answers = {{TEE_ERROR_BAD_PARAMETERS, static_cast<uint32_t>(-13), 0, {}, {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = client.digests(1, 2);
        EXPECT_TRUE(r.status.tee_failed());
        EXPECT_FALSE(r.status.refused());
        EXPECT_EQ(r.status.tee, TEE_ERROR_BAD_PARAMETERS);
        EXPECT_EQ(km::describe(r.status), "TEE_ERROR_BAD_PARAMETERS (0xffff0006)");
        EXPECT_EQ(t.sent.size(), 1u);
    }
    {
        SCOPED_TRACE("TEE failure at the list step of the algorithms");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, 4, 0, {}, {}}, {TEE_ERROR_OUT_OF_MEMORY, 0, 0, {}, {}}};
        km::Client client(t);
        EXPECT_EQ(client.algorithms().status.tee, TEE_ERROR_OUT_OF_MEMORY);
    }
}

TEST(ClientWire, MalformedAnswers) {
    {
        SCOPED_TRACE("an empty list needs no list command");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, 0, 0, {}, {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = client.export_formats(KM_ALGORITHM_AES);
        EXPECT_TRUE(r.ok());
        EXPECT_TRUE(r.value.empty());
        EXPECT_EQ(t.sent.size(), 1u);
    }
    {
        SCOPED_TRACE("an absurd count is not turned into an allocation");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, 0, 0x40000000, {}, {}}};
        km::Client client(t);
        km::Result<km::ValueList> r = client.paddings(1, 0);
        EXPECT_EQ(r.status.tee, TEE_ERROR_BAD_FORMAT);
        EXPECT_EQ(t.sent.size(), 1u);
    }
    {
        SCOPED_TRACE("a list shorter than its count");
        ScriptedTransport t;
        t.answers = {{TEE_SUCCESS, 0, 2, {}, {}}, {TEE_SUCCESS, 0, 0, hex("01000000"), 4u}};
        km::Client client(t);
        EXPECT_EQ(client.paddings(1, 0).status.tee, TEE_ERROR_BAD_FORMAT);
    }
}

// ---- the typed client over the embedded TEE ----

class EmbeddedClient : public ::testing::Test {
  protected:
    ScratchDir scratch_{"km-client"};
    const std::filesystem::path &dir_ = scratch_.path();
};

TEST_F(EmbeddedClient, AnswersFromTheTa) {
    km::EmbeddedTee tee(dir_ / "state", 0);
    EXPECT_TRUE(std::filesystem::is_directory(dir_ / "state"));
    ASSERT_EQ(tee.open(), TEE_SUCCESS);
    km::Client client(tee);

    km::Result<km::ValueList> algorithms = client.algorithms();
    ASSERT_TRUE(algorithms.ok()) << km::describe(algorithms.status);
    EXPECT_EQ(algorithms.value,
              (km::ValueList{KM_ALGORITHM_RSA, KM_ALGORITHM_AES, KM_ALGORITHM_EC, KM_ALGORITHM_HMAC}));

    km::Result<km::ValueList> modes = client.block_modes(KM_ALGORITHM_AES, KM_PURPOSE_ENCRYPT);
    ASSERT_TRUE(modes.ok()) << km::describe(modes.status);
    EXPECT_EQ(modes.value, (km::ValueList{KM_MODE_CBC, KM_MODE_ECB, KM_MODE_CTR, KM_MODE_GCM}));

    km::Result<km::ValueList> rsa_sign = client.paddings(KM_ALGORITHM_RSA, KM_PURPOSE_SIGN);
    ASSERT_TRUE(rsa_sign.ok());
    EXPECT_EQ(rsa_sign.value, (km::ValueList{KM_PAD_NONE, KM_PAD_RSA_PSS, KM_PAD_RSA_PKCS1_1_5_SIGN}));

    km::Result<km::ValueList> rsa_modes = client.block_modes(KM_ALGORITHM_RSA, KM_PURPOSE_ENCRYPT);
    ASSERT_TRUE(rsa_modes.ok());
    EXPECT_TRUE(rsa_modes.value.empty());

    EXPECT_EQ(client.export_formats(KM_ALGORITHM_EC).value, (km::ValueList{KM_KEY_FORMAT_X509}));
    EXPECT_EQ(client.import_formats(KM_ALGORITHM_HMAC).value, (km::ValueList{KM_KEY_FORMAT_RAW}));

    km::Result<km::ValueList> aes_sign = client.digests(KM_ALGORITHM_AES, KM_PURPOSE_SIGN);
    EXPECT_TRUE(aes_sign.status.refused());
    EXPECT_EQ(aes_sign.status.km, KM_ERROR_UNSUPPORTED_PURPOSE);

    km::Result<km::ValueList> unknown = client.import_formats(77);
    EXPECT_TRUE(unknown.status.refused());
    EXPECT_EQ(unknown.status.km, KM_ERROR_UNSUPPORTED_ALGORITHM);
}

TEST_F(EmbeddedClient, SessionLifecycle) {
    km::EmbeddedTee tee(dir_, 0);
    km::Client client(tee);
    EXPECT_EQ(client.algorithms().status.tee, TEE_ERROR_BAD_STATE) << "no session yet";
    ASSERT_EQ(tee.open(), TEE_SUCCESS);
    EXPECT_EQ(tee.open(), TEE_ERROR_BAD_STATE) << "already open";
    EXPECT_TRUE(tee.tee().instance_alive(keymaster_ta_uuid));
    EXPECT_TRUE(client.algorithms().ok());
    tee.close();
    EXPECT_FALSE(tee.tee().instance_alive(keymaster_ta_uuid));
    EXPECT_EQ(client.algorithms().status.tee, TEE_ERROR_BAD_STATE);
    tee.close(); // a second close is harmless
    ASSERT_EQ(tee.open(), TEE_SUCCESS);
    EXPECT_TRUE(client.algorithms().ok());
}

} // namespace
