/*
 * SOTER key material through the command interface: commands 0xFF00 to
 * 0xFF03 against the platform's provisioning TA, made to answer as each
 * case needs, and the loading, retrying and release of the SOTER state.
 */
#include <cstring>
#include <fstream>
#include <string>

#include <openssl/evp.h>

#include "keymaster_defs.h"
#include "rsa_keys.h"
#include "soter_keys.h"
#include "soter_key.h"
#include "ta_entry.h"
#include "ta_fixture.h"

namespace {

namespace prov = tee_host::provisioning;

constexpr uint32_t kSoterOutTypes = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_OUTPUT, TEE_PARAM_TYPE_NONE,
                                                    TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);

struct TestKey {
    prov::FactoryData data;
    Bytes spki; // DER SubjectPublicKeyInfo
};

// The fixed RSA-2048 test key as factory data, with its public key.
const TestKey &test_key() {
    static const TestKey key = [] {
        TestKey k;
        k.data = factory_key(kRsa2048Pem);
        k.data.sensor_name = "sensor";
        k.data.sensor_version = "2.1";
        k.data.fp_ta_uuid = trusted_client_uuids[0];
        k.data.cpu_id = "cpu-42";
        k.spki = spki_of(kRsa2048Pem);
        return k;
    }();
    return key;
}

Bytes tlv(uint16_t type, const Bytes &value) {
    Bytes out = {static_cast<uint8_t>(type), static_cast<uint8_t>(type >> 8), static_cast<uint8_t>(value.size()),
                 static_cast<uint8_t>(value.size() >> 8)};
    out.insert(out.end(), value.begin(), value.end());
    return out;
}

prov::Answer bytes_answer(const Bytes &b) {
    return prov::Answer{TEE_SUCCESS, b};
}
prov::Answer error_answer(TEE_Result r) {
    return prov::Answer{r, {}};
}

class SoterKey : public TaTest {
  protected:
    void provision() { ASSERT_EQ(prov::store(state_dir_, test_key().data, false), prov::StoreResult::stored); }

    int32_t simple(uint32_t cmd) {
        Params p = Params::value();
        EXPECT_EQ(invoke(cmd, p), TEE_SUCCESS);
        return static_cast<int32_t>(p.p[0].value.a);
    }
    int32_t generate() { return simple(KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR); }
    int32_t verify() { return simple(KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR); }

    // A command with an output buffer of cap bytes (none for cap < 0); the
    // buffer is trimmed to the size the TA reports.
    int32_t output_command(uint32_t cmd, int cap, Bytes *out, uint32_t *size_out = nullptr) {
        Params p;
        p.types = kSoterOutTypes;
        out->assign(cap < 0 ? 0 : static_cast<size_t>(cap), 0);
        p.p[2].memref.buffer = cap < 0 ? nullptr : out->data();
        p.p[2].memref.size = cap < 0 ? 0 : static_cast<uint32_t>(cap);
        EXPECT_EQ(invoke(cmd, p), TEE_SUCCESS);
        if (size_out)
            *size_out = p.p[2].memref.size;
        auto code = static_cast<int32_t>(p.p[0].value.a);
        if (code == 0)
            out->resize(p.p[2].memref.size);
        return code;
    }
    int32_t export_attk(int cap, std::string *pem, uint32_t *size_out = nullptr) {
        Bytes out;
        int32_t code = output_command(KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY, cap, &out, size_out);
        if (code == 0) {
            EXPECT_FALSE(out.empty());
            EXPECT_EQ(out.back(), 0) << "the reported size counts the NUL";
            pem->assign(out.begin(), out.end() - (out.empty() ? 0 : 1));
        }
        return code;
    }

    // Closes the session and opens another, so the TA instance (and its
    // SOTER state) starts over; the ended instance must have left nothing.
    void new_instance() {
        tee_->close_session(session_);
        EXPECT_TRUE(tee_host::heap::leaks_at_last_destroy().empty());
        EXPECT_EQ(tee_host::heap::stats().live_count, 0u);
        session_ = open();
    }
};

TEST_F(SoterKey, TheTaCallsThePlatformsProvisioningTa) {
    EXPECT_EQ(std::memcmp(&soter_provisioning_ta_uuid, &tee_host::kProvisioningTaUuid, sizeof(TEE_UUID)), 0);
    // The factory store is reached from trusted applications only.
    uint32_t s = 0;
    EXPECT_EQ(tee_->open_session(tee_host::kProvisioningTaUuid, tee_host::normal_world_identity(), 0, nullptr, &s),
              TEE_ERROR_ACCESS_DENIED);
}

TEST_F(SoterKey, UnprovisionedDevice) {
    EXPECT_EQ(verify(), -1);
    EXPECT_EQ(generate(), KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "soter_handle_generate_attk_key_pair", "attk_key_pair is not produced"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "retrieve_key_from_orvel", "Retrieve key fails, 0xffff0008"));
    std::string pem;
    EXPECT_EQ(export_attk(1024, &pem), -1);
    EXPECT_EQ(extra_allocations(), 0u) << "a failed load keeps nothing";
}

TEST_F(SoterKey, ProvisionedDeviceExportsItsAttk) {
    provision();
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(generate(), 0);
    std::string pem;
    uint32_t size = 0;
    ASSERT_EQ(export_attk(1024, &pem, &size), 0);
    EXPECT_EQ(size, 445u);
    EXPECT_EQ(pem.size(), 444u);
    EXPECT_EQ(spki_of(pem), test_key().spki);
    EXPECT_FALSE(logged_message("This rsa key pair only have n, e, d"));
    // Loaded once: the second export asks the provisioning TA nothing.
    size_t asked = prov::served(prov::Request::key);
    ASSERT_EQ(export_attk(1024, &pem), 0);
    EXPECT_EQ(prov::served(prov::Request::key), asked);
}

TEST_F(SoterKey, StateSurvivesARestartOfTheTee) {
    provision();
    stop();
    start();
    std::string pem;
    ASSERT_EQ(export_attk(1024, &pem), 0);
    EXPECT_EQ(spki_of(pem), test_key().spki);
}

TEST_F(SoterKey, StoreRefusesASecondProvisioningUnlessForced) {
    provision();
    prov::FactoryData other = test_key().data;
    other.cpu_id = "other";
    EXPECT_EQ(prov::store(state_dir_, other, false), prov::StoreResult::already_provisioned);
    other.cpu_id = std::string(65, 'c');
    EXPECT_EQ(prov::store(state_dir_, other, true), prov::StoreResult::invalid);
    other.cpu_id = "c";
    other.q.clear();
    EXPECT_EQ(prov::store(state_dir_, other, true), prov::StoreResult::invalid) << "some CRT values only";
    other.p.clear(), other.dp.clear(), other.dq.clear(), other.qinv.clear();
    EXPECT_EQ(prov::store(state_dir_, other, true), prov::StoreResult::stored);
    EXPECT_TRUE(prov::provisioned(state_dir_));
    std::filesystem::path tmp = state_dir_ / "provisioning" / "factory.bin.tmp";
    EXPECT_FALSE(std::filesystem::exists(tmp));
    auto perms = std::filesystem::status(state_dir_ / "provisioning" / "factory.bin").permissions();
    EXPECT_EQ(perms & (std::filesystem::perms::group_all | std::filesystem::perms::others_all),
              std::filesystem::perms::none);
}

TEST_F(SoterKey, KeyWithOnlyModulusAndExponentsLoads) {
    provision();
    const prov::FactoryData &k = test_key().data;
    Bytes answer = tlv(17, k.n);
    for (const Bytes &b : {tlv(18, k.e), tlv(19, k.d)})
        answer.insert(answer.end(), b.begin(), b.end());
    prov::answer_always(prov::Request::key, bytes_answer(answer));
    std::string pem;
    ASSERT_EQ(export_attk(1024, &pem), 0);
    EXPECT_EQ(spki_of(pem), test_key().spki);
    EXPECT_TRUE(logged(TEE_TRACE_DEBUG, "parse_buf_fill_key", "This rsa key pair only have n, e, d"));
}

TEST_F(SoterKey, MissingSecondPrimeFailsAndTheNextCommandRetries) {
    provision();
    const prov::FactoryData &k = test_key().data;
    Bytes answer;
    for (const Bytes &b :
         {tlv(17, k.n), tlv(18, k.e), tlv(19, k.d), tlv(20, k.p), tlv(22, k.dp), tlv(23, k.dq), tlv(24, k.qinv)})
        answer.insert(answer.end(), b.begin(), b.end());
    prov::answer_next(prov::Request::key, bytes_answer(answer));
    EXPECT_EQ(generate(), KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "init_vlb_with_tag", "Get length error for 15"));
    EXPECT_TRUE(logged_message("Init Soter key pair fail"));
    EXPECT_EQ(extra_allocations(), 0u) << "nothing of the partial key remains";
    // The queued answer is spent: the next command loads the stored key.
    std::string pem;
    ASSERT_EQ(export_attk(1024, &pem), 0);
    EXPECT_EQ(prov::served(prov::Request::key), 2u);
    EXPECT_EQ(spki_of(pem), test_key().spki);
}

TEST_F(SoterKey, FingerprintUuidOfFifteenBytesFailsTheLoad) {
    provision();
    Bytes props = tlv(0x1835, {'s'});
    for (const Bytes &b : {tlv(0x1836, {'1'}), tlv(0x1837, Bytes(15, 1))})
        props.insert(props.end(), b.begin(), b.end());
    prov::answer_next(prov::Request::soter_properties, bytes_answer(props));
    EXPECT_EQ(generate(), KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "init_soter_prop_set", "fp_uuid length unmatch expect 16 actual 15"));
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "init_soter_prop_set", "Init soter data fails, 0xffff0000"));
    EXPECT_EQ(extra_allocations(), 0u);
    EXPECT_EQ(generate(), 0);
}

TEST_F(SoterKey, PropertyFailuresEachFailTheLoad) {
    provision();
    struct Case {
        prov::Request request;
        prov::Answer answer;
        const char *message;
    };
    // Trace messages are captured without their trailing newline.
    const Case cases[] = {
        {prov::Request::soter_properties, bytes_answer(tlv(0x1836, {'1'})),
         "tlv_box_get_bytes_ptr error for tag 0x1835"},
        {prov::Request::soter_properties, bytes_answer(Bytes{0x35, 0x18, 9}), "parse property tlv box error"},
        {prov::Request::soter_properties, error_answer(TEE_ERROR_GENERIC), "Retrieve TA property fails, 0xffff0000"},
        {prov::Request::cpu_id, error_answer(TEE_ERROR_ITEM_NOT_FOUND), "init soter cpuid error 0xffff0008"},
        {prov::Request::cpu_id, bytes_answer(Bytes(65, 'c')), "retrieve soter cpu id error 0xffff0010"},
    };
    for (const Case &c : cases) {
        tee_host::trace::clear();
        prov::answer_next(c.request, c.answer);
        EXPECT_EQ(generate(), KM_ERROR_UNKNOWN_ERROR) << c.message;
        EXPECT_TRUE(logged_message(c.message)) << c.message << dump_log();
        EXPECT_EQ(extra_allocations(), 0u) << c.message;
    }
    // A CPU identifier of exactly 64 bytes fits.
    prov::answer_next(prov::Request::cpu_id, bytes_answer(Bytes(64, 'c')));
    EXPECT_EQ(generate(), 0);
}

TEST_F(SoterKey, VerifyMapsResultsAndRetriesOutOfMemory) {
    prov::answer_always(prov::Request::key, error_answer(TEE_ERROR_GENERIC));
    EXPECT_EQ(verify(), -2);
    prov::reset();
    prov::answer_always(prov::Request::key, error_answer(TEE_ERROR_OUT_OF_MEMORY));
    EXPECT_EQ(verify(), -2);
    EXPECT_EQ(prov::served(prov::Request::key), 3u) << "three attempts in all";
    prov::reset();
    provision();
    prov::answer_next(prov::Request::key, error_answer(TEE_ERROR_OUT_OF_MEMORY));
    prov::answer_next(prov::Request::key, error_answer(TEE_ERROR_OUT_OF_MEMORY));
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(prov::served(prov::Request::key), 3u);
    prov::reset();
    prov::answer_next(prov::Request::key, error_answer(TEE_ERROR_ITEM_NOT_FOUND));
    EXPECT_EQ(verify(), -1);
    EXPECT_EQ(prov::served(prov::Request::key), 1u) << "only out-of-memory is retried";
    // A key answer that does not parse counts as out of memory: retried,
    // then a failure, never an absent key.
    prov::reset();
    prov::answer_always(prov::Request::key, bytes_answer(Bytes{17, 0, 9}));
    EXPECT_EQ(verify(), -2);
    EXPECT_EQ(prov::served(prov::Request::key), 3u);
}

TEST_F(SoterKey, VerifyLeavesTheSharedStateAlone) {
    provision();
    EXPECT_EQ(verify(), 0);
    EXPECT_EQ(extra_allocations(), 0u) << "verify loaded into a local record only";
    prov::answer_always(prov::Request::key, error_answer(TEE_ERROR_ITEM_NOT_FOUND));
    std::string pem;
    EXPECT_EQ(export_attk(1024, &pem), -1) << "verify did not load the state";
}

TEST_F(SoterKey, ExportBufferRules) {
    provision();
    std::string pem;
    uint32_t size = 0;
    EXPECT_EQ(export_attk(100, &pem, &size), KM_ERROR_UNKNOWN_ERROR);
    EXPECT_EQ(size, 100u) << "a failed export leaves the size as given";
    EXPECT_EQ(export_attk(444, &pem, &size), KM_ERROR_UNKNOWN_ERROR) << "the DER fits, its PEM does not";
    EXPECT_EQ(export_attk(-1, &pem), KM_ERROR_INVALID_ARGUMENT);
    EXPECT_EQ(export_attk(445, &pem), 0);
    Params wrong;
    wrong.types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_MEMREF_OUTPUT, 0);
    Bytes out(1024, 0);
    wrong.p[2].memref.buffer = out.data();
    wrong.p[2].memref.size = 1024;
    EXPECT_EQ(invoke(KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY, wrong), TEE_ERROR_BAD_PARAMETERS);
    EXPECT_TRUE(logged(TEE_TRACE_ERROR, "TA_InvokeCommandEntryPoint", "Bad argument type"));
}

TEST_F(SoterKey, DeviceId) {
    Bytes id;
    uint32_t size = 0;
    ASSERT_EQ(output_command(KM_CMD_SOTER_GET_DEVICE_ID, 64, &id, &size), 0);
    ASSERT_EQ(id.size(), 16u);
    // The TEE's device identifier, in its canonical byte order.
    std::ifstream in(state_dir_ / "device_id");
    std::string line;
    ASSERT_TRUE(std::getline(in, line));
    std::string hex_id;
    for (char c : line)
        if (c != '-')
            hex_id += c;
    EXPECT_EQ(to_hex(id), hex_id);

    EXPECT_EQ(output_command(KM_CMD_SOTER_GET_DEVICE_ID, 8, &id, &size), KM_ERROR_INSUFFICIENT_BUFFER_SPACE);
    EXPECT_EQ(size, 8u) << "the size stays as given";
    prov::answer_next(prov::Request::device_id, error_answer(TEE_ERROR_GENERIC));
    EXPECT_EQ(output_command(KM_CMD_SOTER_GET_DEVICE_ID, 64, &id, &size), KM_ERROR_UNKNOWN_ERROR);
    EXPECT_TRUE(
        logged(TEE_TRACE_ERROR, "soter_handle_get_device_id", "retrieve_device_id_from_orvel fail, 0xffff0000"));
    prov::answer_next(prov::Request::device_id, bytes_answer({1, 2, 3}));
    ASSERT_EQ(output_command(KM_CMD_SOTER_GET_DEVICE_ID, 64, &id, &size), 0);
    EXPECT_EQ(id, (Bytes{1, 2, 3}));
}

TEST_F(SoterKey, AllocationFailureSweepLeavesNothingLive) {
    provision();
    struct Command {
        uint32_t id;
        bool keeps_state; // success leaves the SOTER state loaded
    };
    const Command commands[] = {{KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, true},
                                {KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR, false},
                                {KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY, true},
                                {KM_CMD_SOTER_GET_DEVICE_ID, false}};
    for (const Command &c : commands) {
        const bool buffered = c.id == KM_CMD_SOTER_EXPORT_ATTK_PUBLIC_KEY || c.id == KM_CMD_SOTER_GET_DEVICE_ID;
        auto run = [&] {
            Bytes out;
            return Outcome{TEE_SUCCESS, buffered ? output_command(c.id, 1024, &out) : simple(c.id)};
        };
        // What the loaded SOTER state holds, learnt from an undisturbed run.
        new_instance();
        ASSERT_EQ(run().error, 0);
        const size_t loaded = c.keeps_state ? extra_allocations() : 0;
        new_instance();
        int n = 0;
        // The state is loaded whole or not at all (a failure that costs the
        // CRT values leaves an n, e, d key, five buffers fewer); verify and
        // device-id keep nothing. A new instance then releases it.
        auto inspect_and_release = [&] {
            ++n;
            const size_t extra = extra_allocations();
            EXPECT_TRUE(extra == 0 || extra == loaded || (c.keeps_state && extra == loaded - 5))
                << "command " << c.id << " failure " << n << ": " << extra << " blocks live";
            new_instance();
        };
        std::vector<Outcome> allowed = {{TEE_SUCCESS, 0}};
        if (c.id == KM_CMD_SOTER_VERIFY_ATTK_KEY_PAIR)
            allowed.push_back({TEE_SUCCESS, -2});
        else
            allowed.insert(allowed.end(), {{TEE_SUCCESS, KM_ERROR_UNKNOWN_ERROR}, {TEE_SUCCESS, -1}});
        int points = sweep_allocations("command " + std::to_string(c.id), nullptr, run, allowed, inspect_and_release);
        if (c.keeps_state) {
            EXPECT_GT(points, 20) << "loading allocates for every component and property";
        }
    }
    new_instance();
}

} // namespace
