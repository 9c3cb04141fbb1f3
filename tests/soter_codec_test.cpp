/*
 * The TA's SOTER encodings: TLV boxes and their key list, the JSON writer
 * byte for byte, the UTF-8 check, base64 and PEM, and what each leaves on
 * the TA heap when an allocation fails.
 */
#include <cmath>
#include <cstdio>
#include <cstring>
#include <random>
#include <string>

#include "base64.h"
#include "json_writer.h"
#include "key_list.h"
#include "rsa_keys.h"
#include "soter_keys.h"
#include "ta_fixture.h"
#include "ta_heap.h"
#include "tlv_box.h"

namespace {

using Codec = TaTest;

// One TLV entry in wire form.
Bytes tlv(uint16_t type, const Bytes &value) {
    const auto len = static_cast<uint16_t>(value.size());
    return concat({{static_cast<uint8_t>(type), static_cast<uint8_t>(type >> 8), static_cast<uint8_t>(len),
                    static_cast<uint8_t>(len >> 8)},
                   value});
}

Bytes value_of(const tlv_box *box, uint16_t type) {
    const uint8_t *p = nullptr;
    uint32_t n = 0;
    if (tlv_box_get_bytes_ptr(box, type, &p, &n) != 0)
        return {0xDE, 0xAD}; // distinguishable from any value the tests store
    return Bytes(p, p + n);
}

Bytes serialized(const tlv_box *box) {
    const uint8_t *p = tlv_box_get_buffer(box);
    return p ? Bytes(p, p + tlv_box_get_size(box)) : Bytes{};
}

// --- TLV box ------------------------------------------------------------------------

TEST_F(Codec, TlvParseFindsEveryEntryAndFirstDuplicateWins) {
    Bytes wire = concat({tlv(17, {1, 2, 3}), tlv(0x1835, {}), tlv(17, {9}), tlv(0xFFFF, Bytes(300, 0x5A))});
    tlv_box *box = tlv_box_parse(wire.data(), static_cast<uint32_t>(wire.size()));
    ASSERT_NE(box, nullptr);
    EXPECT_EQ(value_of(box, 17), (Bytes{1, 2, 3}));
    EXPECT_EQ(value_of(box, 0x1835), Bytes{});
    EXPECT_EQ(value_of(box, 0xFFFF), Bytes(300, 0x5A));
    EXPECT_EQ(box->entries->count, 3u);
    EXPECT_EQ(tlv_box_get_size(box), wire.size());
    EXPECT_EQ(serialized(box), wire);
    const uint8_t *p = nullptr;
    uint32_t n = 0;
    EXPECT_EQ(tlv_box_get_bytes_ptr(box, 18, &p, &n), -1);
    // Frozen from birth.
    EXPECT_EQ(tlv_box_put_value(box, 1, 5), -1);
    EXPECT_EQ(tlv_box_serialize(box), -1);
    EXPECT_EQ(tlv_box_destroy(box), 0);
}

TEST_F(Codec, TlvTruncatedOrOverlongBuffersAreRefusedWhole) {
    Bytes good = concat({tlv(1, {1, 2}), tlv(2, {3, 4, 5})});
    // Cut anywhere inside the last entry: header or value.
    for (size_t cut = 7; cut < good.size(); ++cut) {
        tlv_box *box = tlv_box_parse(good.data(), static_cast<uint32_t>(cut));
        EXPECT_EQ(box, nullptr) << "cut at " << cut;
        tlv_box_destroy(box);
    }
    // A length that claims more than the buffer holds.
    Bytes overlong = concat({tlv(1, {1}), hex("0200 ff00"), Bytes(10, 7)});
    EXPECT_EQ(tlv_box_parse(overlong.data(), static_cast<uint32_t>(overlong.size())), nullptr);
    // An empty buffer is an empty box.
    tlv_box *empty = tlv_box_parse(good.data(), 0);
    ASSERT_NE(empty, nullptr);
    EXPECT_EQ(empty->entries->count, 0u);
    tlv_box_destroy(empty);
    EXPECT_EQ(extra_allocations(), 0u);
}

TEST_F(Codec, TlvBuildSerializeRoundTrip) {
    tlv_box *box = tlv_box_create();
    ASSERT_NE(box, nullptr);
    EXPECT_EQ(tlv_box_put_bytes(box, 1, Bytes(5, 1).data(), 5), 0);
    EXPECT_EQ(tlv_box_put_bytes(box, 2, nullptr, 0), 0);
    EXPECT_EQ(tlv_box_put_bytes(box, 3, Bytes(10, 3).data(), 10), 0);
    EXPECT_EQ(tlv_box_put_bytes(box, 3, Bytes(1, 4).data(), 1), -1) << "duplicate type";
    EXPECT_EQ(tlv_box_putobject(box, 4, Bytes(65536, 0).data(), 65536), -1) << "over 16 bits";
    EXPECT_EQ(tlv_box_get_size(box), 27u); // lengths 5, 0 and 10
    EXPECT_EQ(tlv_box_get_buffer(box), nullptr);
    ASSERT_EQ(tlv_box_serialize(box), 0);
    // Newest first.
    EXPECT_EQ(serialized(box), concat({tlv(3, Bytes(10, 3)), tlv(2, {}), tlv(1, Bytes(5, 1))}));
    EXPECT_EQ(tlv_box_serialize(box), -1);
    EXPECT_EQ(tlv_box_put_value(box, 9, 'x'), -1);

    tlv_box *back = tlv_box_parse(tlv_box_get_buffer(box), tlv_box_get_size(box));
    ASSERT_NE(back, nullptr);
    EXPECT_EQ(value_of(back, 1), Bytes(5, 1));
    EXPECT_EQ(value_of(back, 2), Bytes{});
    EXPECT_EQ(value_of(back, 3), Bytes(10, 3));
    tlv_box_destroy(back);
    tlv_box_destroy(box);
}

TEST_F(Codec, TlvGetBytesCapacityRules) {
    Bytes wire = tlv(7, {1, 2, 3, 4});
    tlv_box *box = tlv_box_parse(wire.data(), static_cast<uint32_t>(wire.size()));
    ASSERT_NE(box, nullptr);
    uint8_t dest[8];
    std::memset(dest, 0xEE, sizeof dest);
    int32_t len = 3;
    EXPECT_EQ(tlv_box_get_bytes(box, 7, dest, &len), -1);
    EXPECT_EQ(len, 3);
    EXPECT_EQ(Bytes(dest, dest + 8), Bytes(8, 0xEE)) << "a short capacity leaves the destination alone";
    len = 6;
    EXPECT_EQ(tlv_box_get_bytes(box, 7, dest, &len), 0);
    EXPECT_EQ(len, 4);
    EXPECT_EQ(Bytes(dest, dest + 8), (Bytes{1, 2, 3, 4, 0, 0, 0xEE, 0xEE})) << "the whole capacity is zeroed";
    len = 8;
    EXPECT_EQ(tlv_box_get_bytes(box, 8, dest, &len), -1);
    tlv_box_destroy(box);
}

TEST_F(Codec, TlvTypedValuesAndNesting) {
    tlv_box *inner = tlv_box_create();
    ASSERT_NE(inner, nullptr);
    ASSERT_EQ(tlv_box_put_string(inner, 1, "inner"), 0);
    tlv_box *outer = tlv_box_create();
    ASSERT_NE(outer, nullptr);
    EXPECT_EQ(tlv_box_put_object(outer, 10, inner), -1) << "the nested box must be serialized first";
    ASSERT_EQ(tlv_box_serialize(inner), 0);
    EXPECT_EQ(tlv_box_put_object(outer, 10, inner), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 1, 'c'), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 2, int16_t{-2}), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 3, -300000), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 4, int32_t{123456}), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 5, -(int64_t{1} << 40)), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 6, 1.5f), 0);
    EXPECT_EQ(tlv_box_put_value(outer, 7, -2.25), 0);
    EXPECT_EQ(tlv_box_put_string(outer, 8, "text"), 0);
    EXPECT_EQ(value_of(outer, 8), (Bytes{'t', 'e', 'x', 't', 0}));
    EXPECT_EQ(value_of(outer, 2).size(), 2u);
    EXPECT_EQ(value_of(outer, 4).size(), 4u);
    EXPECT_EQ(value_of(outer, 5).size(), 8u);
    ASSERT_EQ(tlv_box_serialize(outer), 0);
    tlv_box *back = tlv_box_parse(tlv_box_get_buffer(outer), tlv_box_get_size(outer));
    ASSERT_NE(back, nullptr);
    char c = 0;
    int16_t s = 0;
    int32_t i = 0, l = 0;
    int64_t ll = 0;
    float f = 0;
    double d = 0;
    EXPECT_EQ(tlv_box_get_value(back, 1, &c), 0);
    EXPECT_EQ(tlv_box_get_value(back, 2, &s), 0);
    EXPECT_EQ(tlv_box_get_value(back, 3, &i), 0);
    EXPECT_EQ(tlv_box_get_value(back, 4, &l), 0);
    EXPECT_EQ(tlv_box_get_value(back, 5, &ll), 0);
    EXPECT_EQ(tlv_box_get_value(back, 6, &f), 0);
    EXPECT_EQ(tlv_box_get_value(back, 7, &d), 0);
    EXPECT_EQ(c, 'c');
    EXPECT_EQ(s, -2);
    EXPECT_EQ(i, -300000);
    EXPECT_EQ(l, 123456);
    EXPECT_EQ(ll, -(int64_t{1} << 40));
    EXPECT_EQ(f, 1.5f);
    EXPECT_EQ(d, -2.25);
    // A value shorter than the width is refused rather than over-read.
    EXPECT_EQ(tlv_box_get_value(back, 3, &ll), -1);
    EXPECT_EQ(tlv_box_get_value(back, 99, &i), -1);
    char text[16] = {};
    int32_t cap = sizeof text;
    EXPECT_EQ(tlv_box_get_string(back, 8, text, &cap), 0);
    EXPECT_STREQ(text, "text");
    tlv_box *nested = nullptr;
    ASSERT_EQ(tlv_box_get_object(back, 10, &nested), 0);
    EXPECT_EQ(value_of(nested, 1), (Bytes{'i', 'n', 'n', 'e', 'r', 0}));
    tlv_box_destroy(nested);
    tlv_box_destroy(back);
    tlv_box_destroy(outer);
    tlv_box_destroy(inner);
}

int g_released = 0;
void count_release(void *) {
    ++g_released;
}

TEST_F(Codec, KeyListLinksReplacesAndRemoves) {
    g_released = 0;
    key_list *list = key_list_create(count_release);
    ASSERT_NE(list, nullptr);
    int a = 1, b = 2, c = 3, d = 4;
    EXPECT_EQ(key_list_add(list, 1, &a), 0);
    EXPECT_EQ(key_list_add(list, 2, &b), 0);
    EXPECT_EQ(key_list_add(list, 3, &c), 0);
    EXPECT_EQ(key_list_add(list, 2, &d), -1);
    EXPECT_EQ(list->count, 3u);
    EXPECT_EQ(list->head->key, 3);
    EXPECT_EQ(key_list_contains(list, 2), 1);
    EXPECT_EQ(key_list_replace(list, 2, &d), 0);
    EXPECT_EQ(g_released, 0) << "replace does not release the old value";
    void *v = nullptr;
    EXPECT_EQ(key_list_get(list, 2, &v), 0);
    EXPECT_EQ(v, &d);
    EXPECT_EQ(key_list_remove(list, 2), 0);
    EXPECT_EQ(g_released, 1);
    EXPECT_EQ(key_list_remove(list, 2), -1);
    EXPECT_EQ(key_list_contains(list, 2), 0);
    EXPECT_EQ(key_list_replace(list, 2, &a), -1);
    // The middle node is gone and both neighbours still link to each other.
    ASSERT_EQ(list->count, 2u);
    EXPECT_EQ(list->head->key, 3);
    EXPECT_EQ(list->head->next->key, 1);
    EXPECT_EQ(list->head->next->prev, list->head);
    EXPECT_EQ(key_list_remove(list, 3), 0);
    EXPECT_EQ(list->head->key, 1);
    EXPECT_EQ(list->head->prev, nullptr);
    key_list_destroy(list);
    EXPECT_EQ(g_released, 3);
}

// --- UTF-8 ---------------------------------------------------------------------------

bool utf8(const Bytes &b) {
    return utf8_is_valid(b.data(), static_cast<uint32_t>(b.size())) == 1;
}

TEST_F(Codec, Utf8AcceptsWellFormedText) {
    EXPECT_TRUE(utf8({}));
    EXPECT_TRUE(utf8(hex("00 7f")));
    EXPECT_TRUE(utf8(hex("c2 80 df bf")));                      // U+0080, U+07FF
    EXPECT_TRUE(utf8(hex("e0 a0 80 ed 9f bf ee 80 80")));       // U+0800, U+D7FF, U+E000
    EXPECT_TRUE(utf8(hex("ef bf bf f0 90 80 80 f4 8f bf bf"))); // U+FFFF, U+10000, U+10FFFF
    EXPECT_TRUE(utf8(Bytes{'h', 0xC3, 0xA9, 'l', 'l', 'o'}));
}

TEST_F(Codec, Utf8RefusesEveryMalformedClass) {
    const char *bad[] = {
        "c0 80",       "c1 bf",                   // overlong two-byte forms (invalid leads)
        "e0 80 80",    "e0 9f bf",                // overlong three-byte
        "f0 80 80 80", "f0 8f bf bf",             // overlong four-byte
        "ed a0 80",    "ed bf bf",                // surrogates U+D800, U+DFFF
        "f4 90 80 80", "f5 80 80 80", "ff",       // above U+10FFFF, invalid leads
        "80",          "bf",                      // continuation without lead
        "c3",          "e2 82",       "f0 9f 98", // truncated at the end
        "c3 41",       "e2 28 a1",                // continuation byte missing
    };
    for (const char *h : bad)
        EXPECT_FALSE(utf8(hex(h))) << h;
    // The length bounds the check: a valid prefix of a cut sequence is refused.
    Bytes euro = hex("e2 82 ac");
    EXPECT_EQ(utf8_is_valid(euro.data(), 2), 0);
    EXPECT_EQ(utf8_is_valid(euro.data(), 3), 1);
}

// --- JSON ---------------------------------------------------------------------------

class Json : public TaTest {
  protected:
    void SetUp() override {
        TaTest::SetUp();
        doc_ = json_doc_create();
        ASSERT_NE(doc_, nullptr);
    }
    void TearDown() override {
        json_doc_free(doc_);
        TaTest::TearDown();
    }
    std::string render() {
        char *text = json_doc_render(doc_);
        if (!text)
            return "<none>";
        std::string s = text;
        json_doc_free_text(text);
        return s;
    }
    std::string number(double v) {
        json_doc_free(doc_);
        doc_ = json_doc_create();
        if (json_doc_set_number(doc_, "n", v) != 0)
            return "<refused>";
        std::string s = render();
        return s.substr(5, s.size() - 6); // {"n":...}
    }
    json_doc *doc_ = nullptr;
};

TEST_F(Json, EmptyObjectAndMemberOrder) {
    EXPECT_EQ(render(), "{}");
    ASSERT_EQ(json_doc_set_string(doc_, "raw", "m"), 0);
    ASSERT_EQ(json_doc_set_number(doc_, "counter", 1), 0);
    ASSERT_EQ(json_doc_set_string(doc_, "raw", "again"), 0);
    ASSERT_EQ(json_doc_set_number(doc_, "uid", 42), 0);
    ASSERT_EQ(json_doc_set_number(doc_, "counter", 2), 0);
    EXPECT_EQ(render(), R"({"raw":"again","counter":2,"uid":42})");
    // Replacing a string by a number keeps the position too.
    ASSERT_EQ(json_doc_set_number(doc_, "raw", 5), 0);
    EXPECT_EQ(render(), R"({"raw":5,"counter":2,"uid":42})");
}

TEST_F(Json, StringEscapesByteForByte) {
    ASSERT_EQ(json_doc_set_string(doc_, "k/\"", "q\" b\\ s/ \b\f\n\r\t \x01\x1f\x7f"), 0);
    EXPECT_EQ(render(), "{\"k\\/\\\"\":\"q\\\" b\\\\ s\\/ \\b\\f\\n\\r\\t \x01\x1f\x7f\"}");
    json_doc_free(doc_);
    doc_ = json_doc_create();
    // Non-ASCII UTF-8 goes out as its bytes, never as \u.
    ASSERT_EQ(json_doc_set_string(doc_, "t", "h\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80"), 0);
    EXPECT_EQ(render(), "{\"t\":\"h\xC3\xA9 \xE2\x82\xAC \xF0\x9F\x98\x80\"}");
}

TEST_F(Json, PemTextRendersWithEscapedSlashesAndLineBreaks) {
    ASSERT_EQ(json_doc_set_string(doc_, "pub_key", "-----BEGIN PUBLIC KEY-----\nab/c+\n-----END PUBLIC KEY-----"), 0);
    EXPECT_EQ(render(), R"({"pub_key":"-----BEGIN PUBLIC KEY-----\nab\/c+\n-----END PUBLIC KEY-----"})");
}

TEST_F(Json, InvalidTextIsRefusedAndLeavesTheDocument) {
    ASSERT_EQ(json_doc_set_string(doc_, "a", "ok"), 0);
    EXPECT_EQ(json_doc_set_string(doc_, "a", "\xC0\x80"), -1);
    EXPECT_EQ(json_doc_set_string(doc_, "b", "\xED\xA0\x80"), -1);
    EXPECT_EQ(json_doc_set_string(doc_, "\xFF", "x"), -1);
    EXPECT_EQ(json_doc_set_string(doc_, "c", nullptr), -1);
    EXPECT_EQ(json_doc_set_string(doc_, nullptr, "x"), -1);
    EXPECT_EQ(json_doc_set_string(nullptr, "d", "x"), -1);
    EXPECT_EQ(json_doc_set_number(doc_, "e", NAN), -1);
    EXPECT_EQ(json_doc_set_number(doc_, "e", INFINITY), -1);
    EXPECT_EQ(render(), R"({"a":"ok"})");
}

TEST_F(Json, IntegralNumbers) {
    EXPECT_EQ(number(0), "0");
    EXPECT_EQ(number(-0.0), "0");
    EXPECT_EQ(number(3), "3");
    EXPECT_EQ(number(7.0), "7");
    EXPECT_EQ(number(-1), "-1");
    EXPECT_EQ(number(2147483647.0), "2147483647");
    EXPECT_EQ(number(2147483648.0), "2147483648"); // 2^31
    EXPECT_EQ(number(-2147483648.0), "-2147483648");
    EXPECT_EQ(number(4294967295.0), "4294967295");             // the largest u32
    EXPECT_EQ(number(9007199254740992.0), "9007199254740992"); // 2^53
    EXPECT_EQ(number(9007199254740993.0), "9007199254740992"); // not a double: rounds to 2^53
    EXPECT_EQ(number(9007199254740994.0), "9007199254740994");
    EXPECT_EQ(number(-9223372036854775808.0), "-9223372036854775808"); // -2^63
    EXPECT_EQ(number(18446744073709551616.0), "18446744073709551616"); // 2^64
    EXPECT_EQ(number(1e22), "10000000000000000000000");
    std::string big = number(1.7976931348623157e308);
    EXPECT_EQ(big.size(), 309u);
    EXPECT_EQ(big.substr(0, 17), "17976931348623157");
}

TEST_F(Json, FractionsMatchPrintfF) {
    EXPECT_EQ(number(2.5), "2.500000");
    EXPECT_EQ(number(0.5), "0.500000");
    EXPECT_EQ(number(-0.25), "-0.250000");
    EXPECT_EQ(number(0.0078125), "0.007812"); // an exact tie rounds to even
    EXPECT_EQ(number(0.0234375), "0.023438");
    EXPECT_EQ(number(1e-7), "0.000000");
    EXPECT_EQ(number(-1e-7), "-0.000000");
    EXPECT_EQ(number(5e-324), "0.000000");
    std::mt19937_64 rng(7);
    std::uniform_real_distribution<double> wide(-1e15, 1e15);
    std::uniform_real_distribution<double> narrow(-2, 2);
    for (int i = 0; i < 2000; ++i) {
        double v = i % 2 ? wide(rng) : narrow(rng);
        if (v == std::trunc(v))
            continue;
        char expect[64] = {};
        std::snprintf(expect, sizeof expect, "%f", v);
        ASSERT_EQ(number(v), expect) << "value " << v;
    }
}

TEST_F(Json, MemberLimit) {
    char name[16] = {};
    for (int i = 0; i < 960; ++i) {
        std::snprintf(name, sizeof name, "m%d", i);
        ASSERT_EQ(json_doc_set_number(doc_, name, i), 0) << i;
    }
    EXPECT_EQ(json_doc_set_number(doc_, "one-more", 1), -1);
    EXPECT_EQ(json_doc_set_number(doc_, "m959", 7), 0) << "existing members can still change";
    std::string text = render();
    EXPECT_TRUE(text.ends_with(",\"m958\":958,\"m959\":7}")) << text.substr(text.size() - 30);
}

// --- base64 and PEM -----------------------------------------------------------------

std::string b64(const std::string &in) {
    char *out = base64_encode(reinterpret_cast<const uint8_t *>(in.data()), static_cast<uint32_t>(in.size()));
    if (!out)
        return "<none>";
    std::string s = out;
    ta_free(out);
    return s;
}

std::string unb64(const char *text) {
    uint8_t *out = nullptr;
    uint32_t n = base64_decode(text, &out);
    std::string s(reinterpret_cast<char *>(out), n);
    ta_free(out);
    return s;
}

TEST_F(Codec, Base64Rfc4648Vectors) {
    const std::pair<const char *, const char *> vectors[] = {
        {"", ""},
        {"f", "Zg=="},
        {"fo", "Zm8="},
        {"foo", "Zm9v"},
        {"foob", "Zm9vYg=="},
        {"fooba", "Zm9vYmE="},
        {"foobar", "Zm9vYmFy"},
        {"abc", "YWJj"},
        {"ab", "YWI="},
    };
    for (const auto &[plain, encoded] : vectors) {
        EXPECT_EQ(b64(plain), encoded);
        EXPECT_EQ(unb64(encoded), plain);
    }
    std::string all;
    for (int i = 0; i < 256; ++i)
        all += static_cast<char>(i);
    std::string enc = b64(all);
    EXPECT_EQ(enc.find('\n'), std::string::npos) << "one line whatever the length";
    EXPECT_EQ(enc.substr(enc.size() - 8), "/P3+/w=="); // fc fd fe, then ff alone
    EXPECT_EQ(unb64(enc.c_str()), all);
    // Characters outside the alphabet are skipped.
    EXPECT_EQ(unb64("Zm9v\nYm Fy\r\n=="), "foobar");
    EXPECT_EQ(base64_encode(nullptr, 0), nullptr);
}

TEST_F(Codec, PemOfAnRsa2048KeyParsesWithOpenSsl) {
    Bytes der = spki_of(kRsa2048Pem);
    ASSERT_EQ(der.size(), 294u);
    Bytes buf(445, 0xEE);
    uint32_t out_len = 0;
    EXPECT_EQ(public_key_to_pem(der.data(), 294, buf.data(), 444, &out_len), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(buf, Bytes(445, 0xEE)) << "nothing written when it does not fit";
    // In place: the DER sits at the start of the destination.
    std::copy(der.begin(), der.end(), buf.begin());
    ASSERT_EQ(public_key_to_pem(buf.data(), 294, buf.data(), 445, &out_len), TEE_SUCCESS);
    EXPECT_EQ(out_len, 445u);
    EXPECT_EQ(buf[444], 0);
    std::string pem(reinterpret_cast<char *>(buf.data()));
    EXPECT_EQ(pem.substr(0, 27), "-----BEGIN PUBLIC KEY-----\n");
    EXPECT_EQ(pem.substr(pem.size() - 25), "\n-----END PUBLIC KEY-----");
    EXPECT_EQ(std::count(pem.begin(), pem.end(), '\n'), 2);

    // OpenSSL reads the one-line PEM back into the same key.
    Bytes back = spki_of(pem);
    EXPECT_EQ(back, der);
    EXPECT_EQ(EVP_PKEY_get_bits(decode_rsa(pem).get()), 2048);
}

// --- Allocation failures ------------------------------------------------------------

TEST_F(Codec, AllocationFailuresLeaveNothingBehind) {
    Bytes wire = concat({tlv(17, Bytes(256, 1)), tlv(18, {1, 0, 1}), tlv(19, Bytes(256, 2))});
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    int points = sweep_allocations("tlv_box_parse", nullptr,
                                   [&] {
                                       tlv_box *box = tlv_box_parse(wire.data(), static_cast<uint32_t>(wire.size()));
                                       bool complete = box && box->entries->count == 3;
                                       tlv_box_destroy(box);
                                       return Outcome{complete ? TEE_SUCCESS : TEE_ERROR_OUT_OF_MEMORY, 0};
                                   },
                                   {oom});
    EXPECT_GT(points, 5);

    points = sweep_allocations("json render", nullptr,
                               [&] {
                                   json_doc *doc = json_doc_create();
                                   int rc = json_doc_set_string(doc, "raw", "a/b") |
                                            json_doc_set_number(doc, "counter", 2.5);
                                   char *text = rc == 0 ? json_doc_render(doc) : nullptr;
                                   std::string s = text ? text : "";
                                   json_doc_free_text(text);
                                   json_doc_free(doc);
                                   // Whatever failed, nothing partial comes out.
                                   EXPECT_TRUE(s.empty() || s == R"({"raw":"a\/b","counter":2.500000})") << s;
                                   return Outcome{s.empty() ? TEE_ERROR_OUT_OF_MEMORY : TEE_SUCCESS, 0};
                               },
                               {oom});
    EXPECT_GE(points, 5);

    Bytes der(294, 0x30);
    Bytes dest(445, 0);
    points = sweep_allocations("public_key_to_pem", nullptr,
                               [&] {
                                   uint32_t n = 0;
                                   return Outcome{public_key_to_pem(der.data(), 294, dest.data(), 445, &n), 0};
                               },
                               {oom});
    EXPECT_EQ(points, 1);
}

} // namespace
