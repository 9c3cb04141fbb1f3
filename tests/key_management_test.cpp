/*
 * Generating, importing, describing, exporting and deleting keys through
 * the command interface, with HMAC keys.
 */
#include <cstring>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "ta_entry.h"

namespace {

using km::ParamSet;

class KeyManagement : public KeyTest {};

ParamSet parse_chars(const Bytes &chars) {
    auto set = ParamSet::parse(chars.data(), chars.size());
    EXPECT_TRUE(set.has_value());
    return set.value_or(ParamSet{});
}

TEST_F(KeyManagement, GenerateThenDescribe) {
    Bytes blob;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok()) << dump_log();
    uint32_t size = 0;
    ASSERT_TRUE(character_size(key_reference(blob), &size).ok());

    Bytes chars;
    ASSERT_TRUE(characteristics(key_reference(blob), &chars, size).ok()) << dump_log();
    EXPECT_EQ(chars.size(), size);
    ParamSet got = parse_chars(chars);
    // The request as given, completed with the origin.
    ParamSet expected = hmac_params();
    expected.add(KM_TAG_ORIGIN, KM_ORIGIN_GENERATED);
    EXPECT_EQ(to_hex(got.serialize()), to_hex(expected.serialize()));

    tee_host::trace::clear();
    Outcome small = characteristics(key_reference(blob), &chars, size - 1);
    EXPECT_EQ(small.res, TEE_ERROR_SHORT_BUFFER);
    EXPECT_TRUE(logged_message("Too short marshalling buffer"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_key_character", "Marshal failed"));
}

TEST_F(KeyManagement, ImportWithAndWithoutKeySize) {
    Bytes material(32);
    for (size_t i = 0; i < material.size(); ++i)
        material[i] = static_cast<uint8_t>(i);
    ParamSet without;
    without.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC).add(KM_TAG_DIGEST, 4).add(KM_TAG_MIN_MAC_LENGTH, 160);
    Bytes blob, chars;
    ASSERT_TRUE(import(without, material, &blob, &chars).ok()) << dump_log();
    ParamSet got = parse_chars(chars);
    ASSERT_NE(got.find(KM_TAG_KEY_SIZE), nullptr);
    EXPECT_EQ(got.find(KM_TAG_KEY_SIZE)->value, 256u);
    EXPECT_EQ(got.find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);

    ParamSet with = without;
    with.add(KM_TAG_KEY_SIZE, 256);
    ASSERT_TRUE(import(with, material, &blob, &chars).ok());
    EXPECT_EQ(parse_chars(chars).count(KM_TAG_KEY_SIZE), 1u);

    ParamSet wrong = without;
    wrong.add(KM_TAG_KEY_SIZE, 128);
    tee_host::trace::clear();
    Outcome o = import(wrong, material, &blob);
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_IMPORT_PARAMETER_MISMATCH);
    EXPECT_TRUE(logged_message("Key size mismatch (given 128, guessed 256)"));
}

TEST_F(KeyManagement, ImportResponseLayoutAndHiddenParameters) {
    ParamSet params = hmac_params();
    params.add_bytes(KM_TAG_APPLICATION_ID, "app").add_bytes(KM_TAG_APPLICATION_DATA, "data");
    params.params(); // the key's binding
    Bytes in;
    km::put_lv(in, params.serialize());
    Bytes material(32, 0x42);
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(2048, 0xEE);
    Params p = Params::io(0, 0, &in, &out);
    ASSERT_EQ(invoke(KM_CMD_IMPORT_KEY, p), TEE_SUCCESS);
    ASSERT_EQ(p.p[0].value.a, 0u) << dump_log();
    uint32_t blob_len = km::get_u32(out.data());
    uint32_t chars_len = km::get_u32(out.data() + 4 + blob_len);
    EXPECT_EQ(p.p[2].memref.size, 8 + blob_len + chars_len);
    ParamSet chars = parse_chars(Bytes(out.begin() + 8 + blob_len, out.begin() + 8 + blob_len + chars_len));
    EXPECT_EQ(chars.count(KM_TAG_APPLICATION_ID), 0u);
    EXPECT_EQ(chars.count(KM_TAG_APPLICATION_DATA), 0u);
    EXPECT_EQ(chars.find(KM_TAG_ORIGIN)->value, KM_ORIGIN_IMPORTED);

    // The characteristics command leaves them out too.
    Bytes blob(out.begin() + 4, out.begin() + 4 + blob_len);
    Bytes again;
    ASSERT_TRUE(characteristics(key_reference(blob, {'a', 'p', 'p'}, {'d', 'a', 't', 'a'}), &again).ok());
    EXPECT_EQ(parse_chars(again).count(KM_TAG_APPLICATION_ID), 0u);
    EXPECT_EQ(again, chars.serialize());
}

TEST_F(KeyManagement, ApplicationIdAndDataBindTheKey) {
    ParamSet params = hmac_params();
    params.add_bytes(KM_TAG_APPLICATION_ID, Bytes{0x61, 0x62, 0x63}).add_bytes(KM_TAG_APPLICATION_DATA, "xyz");
    Bytes blob;
    ASSERT_TRUE(generate(params, &blob).ok());
    const Bytes id{0x61, 0x62, 0x63};
    const Bytes data{'x', 'y', 'z'};
    Bytes chars;
    EXPECT_TRUE(characteristics(key_reference(blob, id, data), &chars).ok());

    struct Case {
        Bytes id, data;
        const char *why;
    };
    const Case refused[] = {
        {{}, data, "KM_TAG_APPLICATION_ID mismatch"},
        {{0x61, 0x62}, data, "KM_TAG_APPLICATION_ID mismatch"},
        {{0x61, 0x62, 0x64}, data, "KM_TAG_APPLICATION_ID mismatch"},
        {id, {}, "KM_TAG_APPLICATION_DATA mismatch"},
        {id, {'x', 'y', 'z', 'z'}, "KM_TAG_APPLICATION_DATA mismatch"},
    };
    for (const Case &c : refused) {
        tee_host::trace::clear();
        for (int cmd = 0; cmd < 3; ++cmd) {
            Outcome o{};
            uint32_t size = 0;
            Bytes out;
            if (cmd == 0)
                o = character_size(key_reference(blob, c.id, c.data), &size);
            else if (cmd == 1)
                o = characteristics(key_reference(blob, c.id, c.data), &out);
            else
                o = export_key(key_reference(blob, c.id, c.data), &out);
            EXPECT_EQ(o.res, TEE_SUCCESS);
            EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB) << c.why << " cmd " << cmd;
            EXPECT_EQ(size, 0u);
        }
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "check_app_id_and_app_data", c.why)) << dump_log();
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_key_character", "Wrong AppId or AppData"));
    }

    // A key bound to nothing accepts any id and data.
    Bytes free_blob;
    ASSERT_TRUE(generate(hmac_params(), &free_blob).ok());
    EXPECT_TRUE(characteristics(key_reference(free_blob, {1, 2, 3}, {4}), &chars).ok());
}

TEST_F(KeyManagement, GenerateRefusals) {
    struct Case {
        const char *what;
        ParamSet params;
        int32_t error;
        const char *log;
    };
    ParamSet two_algorithms = hmac_params();
    two_algorithms.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC);
    ParamSet no_algorithm;
    no_algorithm.add(KM_TAG_KEY_SIZE, 256);
    ParamSet unknown = hmac_params();
    unknown = ParamSet{};
    unknown.add(KM_TAG_ALGORITHM, 2).add(KM_TAG_KEY_SIZE, 256);
    ParamSet with_origin = hmac_params();
    with_origin.add(KM_TAG_ORIGIN, KM_ORIGIN_GENERATED);
    ParamSet usage_twice = hmac_params();
    usage_twice.add(KM_TAG_BLOB_USAGE_REQUIREMENTS, 0).add(KM_TAG_BLOB_USAGE_REQUIREMENTS, 0);
    const Case cases[] = {
        {"two algorithms", two_algorithms, KM_ERROR_INVALID_ARGUMENT, "No KM_TAG_ALGORITHM or many KM_TAG_ALGORITHM"},
        {"no algorithm", no_algorithm, KM_ERROR_INVALID_ARGUMENT, "No KM_TAG_ALGORITHM or many KM_TAG_ALGORITHM"},
        {"unknown algorithm", unknown, KM_ERROR_UNSUPPORTED_ALGORITHM, nullptr},
        {"origin given", with_origin, KM_ERROR_INVALID_ARGUMENT, "Shouldn't specify KM_TAG_ORIGIN"},
        {"blob usage twice", usage_twice, KM_ERROR_INVALID_TAG, "Too many KM_TAG_BLOB_USAGE_REQUIREMENTS specified"},
    };
    for (const Case &c : cases) {
        SCOPED_TRACE(c.what);
        tee_host::trace::clear();
        Bytes in = c.params.serialize();
        Bytes out(1024, 0xEE);
        Params p = Params::io(0, 0, &in, &out);
        EXPECT_EQ(invoke(KM_CMD_GENERATE_KEY, p), TEE_SUCCESS);
        EXPECT_EQ(static_cast<int32_t>(p.p[0].value.a), c.error);
        EXPECT_EQ(p.p[2].memref.size, 0u);
        EXPECT_EQ(out, Bytes(1024, 0)) << "the response is zero-filled";
        if (c.log) {
            EXPECT_TRUE(logged_message(c.log)) << dump_log();
        }
    }

    ParamSet usage_once = hmac_params();
    usage_once.add(KM_TAG_BLOB_USAGE_REQUIREMENTS, 0);
    Bytes blob;
    EXPECT_TRUE(generate(usage_once, &blob).ok());

    Bytes garbage = {5, 0, 0, 0, 1};
    Bytes out(64);
    Params p = Params::io(0, 0, &garbage, &out);
    tee_host::trace::clear();
    EXPECT_EQ(invoke(KM_CMD_GENERATE_KEY, p), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "generate_key", "Unmarshal failed"));
}

TEST_F(KeyManagement, ImportRefusals) {
    Bytes blob;
    Bytes material(32, 1);
    {
        Bytes in = {1, 0};
        Bytes out(64);
        Params p = Params::io(0, 0, &in, &out);
        tee_host::trace::clear();
        EXPECT_EQ(invoke(KM_CMD_IMPORT_KEY, p), TEE_ERROR_GENERIC);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "import_key", "Too short input"));
    }
    {
        // params_len runs past the end of the request.
        Bytes in;
        km::put_u32(in, 100);
        in.resize(40);
        Bytes out(64);
        Params p = Params::io(0, 0, &in, &out);
        EXPECT_EQ(invoke(KM_CMD_IMPORT_KEY, p), TEE_ERROR_GENERIC);
    }
    ParamSet none;
    none.add(KM_TAG_KEY_SIZE, 256);
    tee_host::trace::clear();
    Outcome o = import(none, material, &blob);
    EXPECT_EQ(o.error, KM_ERROR_INVALID_ARGUMENT);
    EXPECT_TRUE(logged_message("No or too many KM_TAG_ALGORITHM"));

    ParamSet unknown;
    unknown.add(KM_TAG_ALGORITHM, 2);
    tee_host::trace::clear();
    o = import(unknown, material, &blob);
    EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_ALGORITHM);
    EXPECT_TRUE(logged_message("Unsupport import_key for algorithm  (2)")) << dump_log();

    // A response buffer too small for the blob is refused and zero-filled.
    Bytes in;
    km::put_lv(in, hmac_params().serialize());
    in.insert(in.end(), material.begin(), material.end());
    Bytes out(100, 0xEE);
    Params p = Params::io(0, 0, &in, &out);
    tee_host::trace::clear();
    EXPECT_EQ(invoke(KM_CMD_IMPORT_KEY, p), TEE_ERROR_SHORT_BUFFER);
    EXPECT_TRUE(logged_message("Too short key blob"));
    EXPECT_TRUE(logged_message("Can't save key to TEE storage"));
    EXPECT_EQ(out, Bytes(100, 0));
    EXPECT_EQ(p.p[2].memref.size, 100u);
}

TEST_F(KeyManagement, KeyReferenceRefusals) {
    Bytes out;
    uint32_t size = 7;
    // Cut inside each of the six fields.
    Bytes full = key_reference(Bytes(120, 1), {1}, {2});
    for (size_t n : {size_t{0}, size_t{3}, size_t{50}, size_t{124}, size_t{127}, size_t{129}, full.size() - 1}) {
        tee_host::trace::clear();
        Bytes cut(full.begin(), full.begin() + static_cast<long>(n));
        EXPECT_EQ(character_size(cut, &size).res, TEE_ERROR_GENERIC) << n;
        EXPECT_EQ(size, 0u);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_key_character_size", "Too short input")) << n;
        EXPECT_EQ(export_key(cut, &out).res, TEE_ERROR_GENERIC);
    }
    for (size_t n : {0, 1}) {
        tee_host::trace::clear();
        Outcome o = characteristics(key_reference(Bytes(n, 0)), &out);
        EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB);
        char msg[32];
        std::snprintf(msg, sizeof msg, "Wrong key_blob_size %zu", n);
        EXPECT_TRUE(logged(TEE_TRACE_ERROR, "get_key_character", msg)) << dump_log();
    }
    // Export leaves the size check to the blob reader.
    tee_host::trace::clear();
    Outcome o = export_key(key_reference(Bytes(1, 0)), &out);
    EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "open_key", "Too short key blob"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "export_key", "Open key failed"));
}

TEST_F(KeyManagement, ExportOfSymmetricAndSoterKeys) {
    Bytes blob, out;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok());
    tee_host::trace::clear();
    Outcome o = export_key(key_reference(blob), &out);
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_UNSUPPORTED_KEY_FORMAT);
    EXPECT_TRUE(logged(TEE_TRACE_DEBUG, "export_key", "normal export_key"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "export_key", "Export key failed"));

    // A SOTER key never reaches the provider: its export is a SOTER
    // document around an RSA public key, which an HMAC key has not.
    ParamSet soter = hmac_params();
    soter.add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
    ASSERT_TRUE(generate(soter, &blob).ok());
    tee_host::trace::clear();
    o = export_key(key_reference(blob), &out);
    EXPECT_EQ(o.res, TEE_ERROR_BAD_FORMAT);
    EXPECT_EQ(o.error, KM_ERROR_OK);
    EXPECT_TRUE(logged_message("resolve key from data stream error")) << dump_log();
    EXPECT_TRUE(logged(TEE_TRACE_DEBUG, "export_key", "soter export_key"));
    EXPECT_FALSE(logged_message("Export key failed"));
    EXPECT_FALSE(logged_message("normal export_key"));
}

TEST_F(KeyManagement, DeleteForgetsOnlyWhatTheCallerHolds) {
    tee_host::trace::clear();
    Outcome o = delete_key(Bytes{7});
    EXPECT_EQ(o.res, TEE_SUCCESS);
    EXPECT_EQ(o.error, KM_ERROR_INVALID_KEY_BLOB);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "delete_key", "Keystore delete key failed"));
    EXPECT_TRUE(delete_key(Bytes{7, 8}).ok());
    EXPECT_TRUE(delete_all().ok());
    // Blobs still open afterwards: the TA stores nothing per key.
    Bytes blob, chars;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok());
    EXPECT_TRUE(delete_key(blob).ok());
    EXPECT_TRUE(delete_all().ok());
    EXPECT_TRUE(characteristics(key_reference(blob), &chars).ok());
}

// Each allocation of a command fails in turn: the command reports the
// shortage (a TEE result, or the provider's Keymaster error), holds nothing.
TEST_F(KeyManagement, AllocationFailuresLeaveNothingBehind) {
    Bytes blob;
    ASSERT_TRUE(generate(hmac_params(), &blob).ok());
    Bytes material(32, 3);
    const Outcome oom{TEE_ERROR_OUT_OF_MEMORY, 0};
    const Outcome unparsed{TEE_ERROR_BAD_PARAMETERS, 0};
    const Outcome provider_oom{TEE_SUCCESS, KM_ERROR_MEMORY_ALLOCATION_FAILED};
    const uint32_t trusted = open(&trusted_client_uuids[0]);
    // Opening a blob: its buffers (-41), its parameter set (-38), the TEE's objects.
    const std::vector<Outcome> opening = {oom, provider_oom, {TEE_SUCCESS, KM_ERROR_INVALID_ARGUMENT}};
    struct Step {
        const char *name;
        std::function<Outcome()> run;
        std::vector<Outcome> allowed;
    };
    const Step steps[] = {
        {"generate",
         [&] {
             Bytes b;
             return generate(hmac_params(), &b);
         },
         {oom, unparsed}},
        {"import",
         [&] {
             Bytes b;
             return import(hmac_params(), material, &b);
         },
         {oom, unparsed, provider_oom}},
        {"character size",
         [&] {
             uint32_t s = 0;
             return character_size(key_reference(blob), &s);
         },
         opening},
        {"characteristics",
         [&] {
             Bytes c;
             return characteristics(key_reference(blob), &c);
         },
         opening},
        {"export",
         [&] {
             Bytes c;
             return export_key(key_reference(blob), &c);
         },
         opening},
        // A trusted TA opening the blob raw: TEE results only.
        {"open raw",
         [&] {
             Bytes payload;
             return Outcome{open_raw(trusted, blob, &payload), 0};
         },
         {oom}},
    };
    for (const Step &step : steps)
        EXPECT_GT(sweep_allocations(step.name, nullptr, step.run, step.allowed), 0) << step.name;
    tee_->close_session(trusted);
}

} // namespace
