/*
 * Commands 1 to 12 through the entry glue: counts, lists, the exact
 * buffer-size rule and the errors for unsupported algorithms and purposes.
 */
#include "keymaster_defs.h"
#include "ta_entry.h"
#include "ta_fixture.h"

namespace {

using List = std::vector<uint32_t>;

Bytes le(const List &values) {
    Bytes b;
    for (uint32_t v : values)
        for (int i = 0; i < 4; ++i)
            b.push_back(static_cast<uint8_t>(v >> (8 * i)));
    return b;
}

class Capability : public TaTest {
  protected:
    struct Answer {
        TEE_Result res;
        int32_t error;
        uint32_t count;
    };
    Answer count(uint32_t cmd, uint32_t a, uint32_t b) {
        Params p = Params::value(a, b);
        TEE_Result res = invoke(cmd, p);
        return {res, static_cast<int32_t>(p.p[0].value.a), p.p[0].value.b};
    }
    // Runs a list command with a buffer of `size` bytes pre-filled with 0xEE.
    Answer list(uint32_t cmd, uint32_t a, uint32_t b, size_t size, Bytes *out) {
        out->assign(size, 0xEE);
        Params p = Params::io(a, b, nullptr, out);
        TEE_Result res = invoke(cmd, p);
        EXPECT_EQ(p.p[2].memref.size, size) << "list commands never resize params[2]";
        return {res, static_cast<int32_t>(p.p[0].value.a), p.p[0].value.b};
    }
};

TEST_F(Capability, AlgorithmCountAndList) {
    Answer n = count(KM_CMD_GET_SUPPORT_ALGO_CNT, 0, 0);
    EXPECT_EQ(n.res, TEE_SUCCESS);
    EXPECT_EQ(n.error, 4);
    EXPECT_EQ(n.count, 0u);

    Bytes out;
    Answer a = list(KM_CMD_GET_SUPPORT_ALGO, 0, 0, 16, &out);
    EXPECT_EQ(a.res, TEE_SUCCESS);
    EXPECT_EQ(a.error, 0);
    EXPECT_EQ(out, hex("01000000 20000000 03000000 80000000"));

    for (size_t wrong : {0, 15, 20}) {
        tee_host::trace::clear();
        Answer w = list(KM_CMD_GET_SUPPORT_ALGO, 0, 0, wrong, &out);
        EXPECT_EQ(w.res, TEE_ERROR_BAD_PARAMETERS) << wrong;
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_algo", "Output buffer doesn't match")) << dump_log();
        EXPECT_EQ(out, Bytes(wrong, 0xEE));
    }
}

struct PurposeCase {
    const char *what;
    uint32_t count_cmd;
    uint32_t algorithm;
    uint32_t purpose;
    List expected;
};

const PurposeCase kPurposeCases[] = {
    {"aes modes encrypt", 3, KM_ALGORITHM_AES, KM_PURPOSE_ENCRYPT, {2, 1, 3, 32}},
    {"aes modes decrypt", 3, KM_ALGORITHM_AES, KM_PURPOSE_DECRYPT, {2, 1, 3, 32}},
    {"rsa modes encrypt", 3, KM_ALGORITHM_RSA, KM_PURPOSE_ENCRYPT, {}},
    {"rsa modes verify", 3, KM_ALGORITHM_RSA, KM_PURPOSE_VERIFY, {}},
    {"ec modes sign", 3, KM_ALGORITHM_EC, KM_PURPOSE_SIGN, {}},
    {"hmac modes verify", 3, KM_ALGORITHM_HMAC, KM_PURPOSE_VERIFY, {}},
    {"rsa paddings encrypt", 5, KM_ALGORITHM_RSA, KM_PURPOSE_ENCRYPT, {1, 4, 2}},
    {"rsa paddings decrypt", 5, KM_ALGORITHM_RSA, KM_PURPOSE_DECRYPT, {1, 4, 2}},
    {"rsa paddings sign", 5, KM_ALGORITHM_RSA, KM_PURPOSE_SIGN, {1, 3, 5}},
    {"rsa paddings verify", 5, KM_ALGORITHM_RSA, KM_PURPOSE_VERIFY, {1, 3, 5}},
    {"aes paddings", 5, KM_ALGORITHM_AES, KM_PURPOSE_ENCRYPT, {1, 64}},
    {"ec paddings", 5, KM_ALGORITHM_EC, KM_PURPOSE_SIGN, {}},
    {"rsa digests encrypt", 7, KM_ALGORITHM_RSA, KM_PURPOSE_ENCRYPT, {0, 1, 2, 3, 4, 5, 6}},
    {"rsa digests sign", 7, KM_ALGORITHM_RSA, KM_PURPOSE_SIGN, {0, 1, 2, 3, 4, 5, 6}},
    {"ec digests", 7, KM_ALGORITHM_EC, KM_PURPOSE_SIGN, {1, 2, 3, 4, 5, 6}},
    {"hmac digests", 7, KM_ALGORITHM_HMAC, KM_PURPOSE_VERIFY, {1, 2, 3, 4, 5, 6}},
    {"aes digests", 7, KM_ALGORITHM_AES, KM_PURPOSE_DECRYPT, {}},
};

TEST_F(Capability, PurposeListsMatchTheProviders) {
    for (const PurposeCase &c : kPurposeCases) {
        SCOPED_TRACE(c.what);
        Answer n = count(c.count_cmd, c.algorithm, c.purpose);
        ASSERT_EQ(n.res, TEE_SUCCESS);
        EXPECT_EQ(n.error, 0);
        ASSERT_EQ(n.count, c.expected.size());

        Bytes out;
        Answer l = list(c.count_cmd + 1, c.algorithm, c.purpose, 4 * c.expected.size(), &out);
        EXPECT_EQ(l.res, TEE_SUCCESS);
        EXPECT_EQ(l.error, 0);
        EXPECT_EQ(out, le(c.expected));

        // One word more or less than the count is refused and writes nothing.
        for (size_t size : {4 * c.expected.size() + 4, c.expected.empty() ? size_t{3} : 4 * c.expected.size() - 4}) {
            tee_host::trace::clear();
            Answer w = list(c.count_cmd + 1, c.algorithm, c.purpose, size, &out);
            EXPECT_EQ(w.res, TEE_ERROR_BAD_PARAMETERS) << size;
            EXPECT_TRUE(logged_message("Output buffer doesn't match"));
            EXPECT_EQ(out, Bytes(size, 0xEE));
        }
    }
}

TEST_F(Capability, ListRefusalsNameTheListCommand) {
    Bytes out;
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_BLK_MODE, KM_ALGORITHM_AES, KM_PURPOSE_ENCRYPT, 12, &out).res,
              TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_blk_mode", "Output buffer doesn't match")) << dump_log();
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_PADDING_MODE, KM_ALGORITHM_AES, KM_PURPOSE_ENCRYPT, 4, &out).res,
              TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_padding_mode", "Output buffer doesn't match"));
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_DIGEST, KM_ALGORITHM_EC, KM_PURPOSE_SIGN, 28, &out).res,
              TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_digest", "Output buffer doesn't match"));
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_IMPORT_FORMAT, KM_ALGORITHM_RSA, 0, 8, &out).res, TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_import_format", "Output buffer doesn't match"));
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_EXPORT_FORMAT, KM_ALGORITHM_AES, 0, 4, &out).res, TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_support_export_format", "Output buffer doesn't match"));
}

TEST_F(Capability, UnsupportedPurposesAndAlgorithms) {
    struct Case {
        uint32_t algorithm, purpose;
    };
    // No table: AES sign/verify, EC and HMAC encrypt/decrypt, purposes above 3, unknown algorithms.
    const Case cases[] = {{KM_ALGORITHM_AES, 2}, {KM_ALGORITHM_AES, 3}, {KM_ALGORITHM_EC, 0}, {KM_ALGORITHM_HMAC, 1},
                          {KM_ALGORITHM_RSA, 4}, {KM_ALGORITHM_RSA, 7}, {2, KM_PURPOSE_SIGN}, {0, 0}};
    for (const Case &c : cases) {
        for (uint32_t cmd : {3u, 5u, 7u}) {
            SCOPED_TRACE(testing::Message() << "cmd " << cmd << " alg " << c.algorithm << " purpose " << c.purpose);
            Answer n = count(cmd, c.algorithm, c.purpose);
            EXPECT_EQ(n.res, TEE_SUCCESS);
            EXPECT_EQ(n.error, KM_ERROR_UNSUPPORTED_PURPOSE);
            EXPECT_EQ(n.count, 0u);
            // The list command reports the same whatever the buffer size.
            for (size_t size : {0, 8, 24}) {
                Bytes out;
                Answer l = list(cmd + 1, c.algorithm, c.purpose, size, &out);
                EXPECT_EQ(l.res, TEE_SUCCESS);
                EXPECT_EQ(l.error, KM_ERROR_UNSUPPORTED_PURPOSE);
                EXPECT_EQ(out, Bytes(size, 0xEE));
            }
        }
    }
}

TEST_F(Capability, KeyFormats) {
    struct Case {
        uint32_t algorithm;
        List import_formats, export_formats;
    };
    const Case cases[] = {{KM_ALGORITHM_RSA, {1}, {0}},
                          {KM_ALGORITHM_EC, {1}, {0}},
                          {KM_ALGORITHM_AES, {3}, {}},
                          {KM_ALGORITHM_HMAC, {3}, {}}};
    for (const Case &c : cases) {
        SCOPED_TRACE(c.algorithm);
        for (auto [cmd, expected] : {std::pair{9u, c.import_formats}, std::pair{11u, c.export_formats}}) {
            Answer n = count(cmd, c.algorithm, 0);
            EXPECT_EQ(n.res, TEE_SUCCESS);
            EXPECT_EQ(n.error, 0);
            EXPECT_EQ(n.count, expected.size());
            Bytes out;
            Answer l = list(cmd + 1, c.algorithm, 0, 4 * expected.size(), &out);
            EXPECT_EQ(l.res, TEE_SUCCESS);
            EXPECT_EQ(l.error, 0);
            EXPECT_EQ(out, le(expected));
        }
    }
    for (uint32_t cmd : {9u, 11u}) {
        Answer n = count(cmd, 2, 0);
        EXPECT_EQ(n.res, TEE_SUCCESS);
        EXPECT_EQ(n.error, KM_ERROR_UNSUPPORTED_ALGORITHM);
        EXPECT_EQ(n.count, 0u);
        Bytes out;
        Answer l = list(cmd + 1, 2, 0, 4, &out);
        EXPECT_EQ(l.res, TEE_SUCCESS);
        EXPECT_EQ(l.error, KM_ERROR_UNSUPPORTED_ALGORITHM);
        EXPECT_EQ(out, Bytes(4, 0xEE));
    }
}

TEST_F(Capability, RsaSigningBlockModesAcceptOnlyAnEmptyBuffer) {
    Bytes out;
    Answer l = list(KM_CMD_GET_SUPPORT_BLK_MODE, KM_ALGORITHM_RSA, KM_PURPOSE_SIGN, 0, &out);
    EXPECT_EQ(l.res, TEE_SUCCESS);
    EXPECT_EQ(l.error, 0);
    EXPECT_EQ(list(KM_CMD_GET_SUPPORT_BLK_MODE, KM_ALGORITHM_RSA, KM_PURPOSE_SIGN, 4, &out).res,
              TEE_ERROR_BAD_PARAMETERS);
}

} // namespace
