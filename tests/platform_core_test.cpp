/*
 * The emulated TEE's core services: the TA heap, trace, clocks, random
 * source, properties, sessions and TA-to-TA calls. A small probe TA runs
 * inside the Tee to see the platform as a TA does.
 */
#include <atomic>
#include <chrono>
#include <cstring>
#include <fstream>
#include <thread>

#include "scratch_dir.h"
#include "ta_entry.h"
#include "ta_fixture.h"

namespace {

// --- The probe TA -----------------------------------------------------------

const TEE_UUID kProbeUuid = trusted_client_uuids[0];
std::atomic<int> g_inside{0};
std::atomic<int> g_max_inside{0};
std::atomic<int> g_creates{0};
std::atomic<int> g_destroys{0};
TEE_Result g_create_result = TEE_SUCCESS;

enum ProbeCmd : uint32_t {
    PROBE_CLIENT_IDENTITY = 1, // memref out: the 20-byte identity
    PROBE_PROPERTY_STRING = 2, // memref in: "set\0name", memref out: value
    PROBE_CALL_KEYMASTER = 3,  // value out: a = TEE_Result, b = algorithm count; memref in: command 27 result
    PROBE_SLOW = 4,            // sleeps while counting concurrent callers
    PROBE_LEAK = 5,            // allocates a block and forgets it
};

TEE_Result probe_create() {
    ++g_creates;
    return g_create_result;
}
void probe_destroy() {
    ++g_destroys;
}
TEE_Result probe_open(uint32_t, TEE_Param *, void **ctx) {
    *ctx = nullptr;
    return TEE_SUCCESS;
}
void probe_close(void *) {}

TEE_PropSetHandle set_by_name(const char *name) {
    if (!std::strcmp(name, "ta"))
        return TEE_PROPSET_CURRENT_TA;
    if (!std::strcmp(name, "client"))
        return TEE_PROPSET_CURRENT_CLIENT;
    return TEE_PROPSET_TEE_IMPLEMENTATION;
}

TEE_Result probe_invoke(void *, uint32_t cmd, uint32_t, TEE_Param p[4]) {
    switch (cmd) {
    case PROBE_CLIENT_IDENTITY: {
        TEE_Identity id{};
        TEE_Result res = TEE_GetPropertyAsIdentity(TEE_PROPSET_CURRENT_CLIENT, "gpd.client.identity", &id);
        std::memcpy(p[2].memref.buffer, &id, sizeof id);
        return res;
    }
    case PROBE_PROPERTY_STRING: {
        const char *set = static_cast<const char *>(p[1].memref.buffer);
        const char *name = set + std::strlen(set) + 1;
        return TEE_GetPropertyAsString(set_by_name(set), name, static_cast<char *>(p[2].memref.buffer),
                                       &p[2].memref.size);
    }
    case PROBE_CALL_KEYMASTER: {
        TEE_TASessionHandle s = nullptr;
        uint32_t origin = 0;
        TEE_Result res = TEE_OpenTASession(&keymaster_ta_uuid, TEE_TIMEOUT_INFINITE, 0, nullptr, &s, &origin);
        if (res != TEE_SUCCESS)
            return res;
        TEE_Param q[4] = {};
        res = TEE_InvokeTACommand(s, TEE_TIMEOUT_INFINITE, 1, 0x0003, q, &origin);
        p[0].value.a = res;
        p[0].value.b = q[0].value.a;
        TEE_Param k[4] = {};
        k[0].memref.buffer = p[1].memref.buffer;
        k[0].memref.size = p[1].memref.size;
        p[0].value.a = TEE_InvokeTACommand(s, TEE_TIMEOUT_INFINITE, 27, 0x0007, k, &origin);
        TEE_CloseTASession(s);
        return res;
    }
    case PROBE_SLOW: {
        int now = ++g_inside;
        int seen = g_max_inside.load();
        while (now > seen && !g_max_inside.compare_exchange_weak(seen, now)) {
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(2));
        --g_inside;
        return TEE_SUCCESS;
    }
    case PROBE_LEAK:
        return TEE_MallocAt(24, 0, "/src/ta/leaky.cpp", 77) ? TEE_SUCCESS : TEE_ERROR_OUT_OF_MEMORY;
    default:
        return TEE_ERROR_BAD_PARAMETERS;
    }
}

const uint32_t kProbeData = 0x1000;
const ta_property_t kProbeProps[] = {{"gpd.ta.dataSize", TA_PROP_U32, &kProbeData},
                                     {"gpd.ta.description", TA_PROP_STRING, "probe"}};
const ta_header_t kProbeHeader = {kProbeUuid, 0x1000,      0xF,          probe_create, probe_destroy,
                                  probe_open, probe_close, probe_invoke, nullptr,      0};
const ta_header_t kProbeWithProps = {kProbeUuid, 0x1000,      0xF,          probe_create, probe_destroy,
                                     probe_open, probe_close, probe_invoke, kProbeProps,  2};

class Platform : public TaTest {
  protected:
    void SetUp() override {
        TaTest::SetUp();
        g_creates = g_destroys = 0;
        g_create_result = TEE_SUCCESS;
        tee_->install_ta(&kProbeHeader);
    }
    uint32_t open_probe(const TEE_Identity &id) {
        uint32_t s = 0;
        EXPECT_EQ(tee_->open_session(kProbeUuid, id, 0, nullptr, &s), TEE_SUCCESS);
        return s;
    }
    std::string property(uint32_t s, const std::string &set, const std::string &name, TEE_Result *res = nullptr) {
        std::string in = set + '\0' + name + '\0';
        Bytes out(128);
        TEE_Param p[4] = {};
        p[1].memref.buffer = in.data();
        p[1].memref.size = static_cast<uint32_t>(in.size());
        p[2].memref.buffer = out.data();
        p[2].memref.size = 128;
        TEE_Result r = tee_->invoke(s, PROBE_PROPERTY_STRING, 0x0650, p);
        if (res)
            *res = r;
        return r == TEE_SUCCESS ? std::string(reinterpret_cast<char *>(out.data())) : std::string();
    }
};

// --- Heap --------------------------------------------------------------------

TEST_F(Platform, HeapZeroFillsAndGivesBlocksForZeroBytes) {
    const auto before = tee_host::heap::stats();
    auto *p = static_cast<uint8_t *>(TEE_Malloc(64, TEE_MALLOC_FILL_ZERO));
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(Bytes(p, p + 64), Bytes(64, 0));
    void *z1 = TEE_Malloc(0, 0);
    void *z2 = TEE_Malloc(0, 0);
    EXPECT_NE(z1, nullptr);
    EXPECT_NE(z1, z2);
    auto st = tee_host::heap::stats();
    EXPECT_EQ(st.live_count, before.live_count + 3);
    EXPECT_EQ(st.live_bytes, before.live_bytes + 64);
    p[0] = 7;
    auto *q = static_cast<uint8_t *>(TEE_Realloc(p, 128));
    ASSERT_NE(q, nullptr);
    EXPECT_EQ(q[0], 7);
    EXPECT_EQ(Bytes(q + 64, q + 128), Bytes(64, 0));
    TEE_Free(q);
    TEE_Free(z1);
    TEE_Free(z2);
    TEE_Free(nullptr);
    EXPECT_EQ(tee_host::heap::stats().live_bytes, before.live_bytes);
}

TEST_F(Platform, HeapIsBoundedByTheTaDataSize) {
    const auto st = tee_host::heap::stats();
    EXPECT_EQ(st.limit, 0x80000u);
    const uint32_t room = static_cast<uint32_t>(st.limit - st.live_bytes);
    void *big = TEE_Malloc(room, 0);
    ASSERT_NE(big, nullptr);
    EXPECT_EQ(TEE_Malloc(1, 0), nullptr);
    TEE_Free(big);
    void *half = TEE_Malloc(room / 2, 0);
    ASSERT_NE(half, nullptr);
    // A failed growth keeps the old block.
    EXPECT_EQ(TEE_Realloc(half, room + 1), nullptr);
    EXPECT_EQ(tee_host::heap::stats().live_bytes, st.live_bytes + room / 2);
    TEE_Free(half);
    EXPECT_EQ(tee_host::heap::stats().peak_bytes, 0x80000u);
}

TEST_F(Platform, HeapFailsTheNthAllocationOnce) {
    tee_host::heap::fail_nth(3);
    void *a = TEE_Malloc(1, 0);
    void *b = TEE_Malloc(1, 0);
    EXPECT_FALSE(tee_host::heap::injected_failure_fired());
    EXPECT_EQ(TEE_Malloc(1, 0), nullptr);
    EXPECT_TRUE(tee_host::heap::injected_failure_fired());
    void *d = TEE_Malloc(1, 0);
    EXPECT_NE(d, nullptr);
    TEE_Free(a);
    TEE_Free(b);
    TEE_Free(d);
}

TEST_F(Platform, LeaksAreNamedWhenTheInstanceEnds) {
    const size_t before = tee_host::heap::stats().live_count;
    uint32_t s = open_probe(tee_host::normal_world_identity());
    ASSERT_EQ(tee_->invoke(s, PROBE_LEAK, 0, nullptr), TEE_SUCCESS);
    EXPECT_EQ(tee_host::heap::stats().live_count, before + 1);
    tee_->close_session(s);
    auto leaks = tee_host::heap::leaks_at_last_destroy();
    ASSERT_EQ(leaks.size(), 1u);
    EXPECT_EQ(leaks[0].size, 24u);
    EXPECT_EQ(leaks[0].file, "/src/ta/leaky.cpp");
    EXPECT_EQ(leaks[0].line, 77);
    // Reclaimed as a real TEE would, and only the ended instance's blocks.
    EXPECT_EQ(tee_host::heap::stats().live_count, before);
    EXPECT_TRUE(tee_->instance_alive(keymaster_ta_uuid));
    // The Keymaster TA's own instance ends clean.
    tee_->close_session(session_);
    EXPECT_TRUE(tee_host::heap::leaks_at_last_destroy().empty());
    EXPECT_EQ(tee_host::heap::stats().live_count, 0u);
    session_ = open();
}

TEST(PlatformDeath, FreeingAForeignPointerPanics) {
    EXPECT_DEATH(
        {
            tee_host::Tee tee;
            int x = 0;
            TEE_Free(&x);
        },
        "TEE_Free of a pointer the heap did not hand out");
}

// --- Trace -------------------------------------------------------------------

TEST_F(Platform, TraceLinesHaveTheirLevelNamesAndAreCutAt256Bytes) {
    tee_host::trace::clear();
    TEE_Trace(TEE_TRACE_ERROR, "KEYMASTER", "f1", 10, "error %d\n", 1);
    TEE_Trace(TEE_TRACE_INFO, "KEYMASTER", "f2", 20, "info");
    TEE_Trace(TEE_TRACE_DEBUG, "KEYMASTER", "f3", 30, "debug");
    TEE_Trace(TEE_TRACE_FLOW, "KEYMASTER", "f4", 40, "flow");
    std::string longtext(400, 'x');
    TEE_Trace(TEE_TRACE_ERROR, "KEYMASTER", "f5", 50, "%s", longtext.c_str());
    auto lines = tee_host::trace::captured();
    ASSERT_EQ(lines.size(), 5u);
    EXPECT_EQ(lines[0].formatted, "ERR KEYMASTER:f1:10: error 1\n");
    EXPECT_EQ(lines[0].message, "error 1");
    EXPECT_EQ(lines[1].formatted, "INF KEYMASTER:f2:20: info\n");
    EXPECT_EQ(lines[2].formatted, "DBG KEYMASTER:f3:30: debug\n");
    EXPECT_EQ(lines[3].formatted, "FLW KEYMASTER:f4:40: flow\n");
    EXPECT_EQ(lines[4].formatted.size(), 256u);
    EXPECT_EQ(lines[4].formatted.back(), '\n');
    EXPECT_EQ(lines[4].formatted.rfind("ERR KEYMASTER:f5:50: xxx", 0), 0u);
}

TEST_F(Platform, TraceWritesToStderrUpToItsLevel) {
    tee_host::trace::set_level(TEE_TRACE_INFO);
    testing::internal::CaptureStderr();
    TEE_Trace(TEE_TRACE_INFO, "KEYMASTER", "shown", 1, "yes");
    TEE_Trace(TEE_TRACE_DEBUG, "KEYMASTER", "hidden", 2, "no");
    std::string err = testing::internal::GetCapturedStderr();
    EXPECT_EQ(err, "INF KEYMASTER:shown:1: yes\n");
    tee_host::trace::set_level(0);
}

TEST(PlatformTrace, ThreadNumbersWhenTheTeeSuppliesThem) {
    tee_host::Config config;
    config.trace_thread_ids = true;
    config.trace_level = 0;
    tee_host::Tee tee(config);
    tee_host::trace::capture(true);
    TEE_Trace(TEE_TRACE_ERROR, "KEYMASTER", "fn", 5, "text");
    auto lines = tee_host::trace::captured();
    ASSERT_EQ(lines.size(), 1u);
    const std::string &f = lines[0].formatted;
    EXPECT_EQ(f.rfind("ERR [0x", 0), 0u) << f;
    EXPECT_NE(f.find("] KEYMASTER:fn:5: text\n"), std::string::npos) << f;
}

// --- Clocks and random source -------------------------------------------------

TEST_F(Platform, FrozenClocksMoveOnlyWhenAdvanced) {
    tee_host::clock::freeze();
    tee_host::clock::set_ree_ms(1700000000123ull);
    TEE_Time sys1{}, ree1{};
    TEE_GetSystemTime(&sys1);
    TEE_GetREETime(&ree1);
    EXPECT_EQ(ree1.seconds, 1700000000u);
    EXPECT_EQ(ree1.millis, 123u);
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    TEE_Time sys2{};
    TEE_GetSystemTime(&sys2);
    EXPECT_EQ(sys2.seconds * 1000 + sys2.millis, sys1.seconds * 1000 + sys1.millis);

    tee_host::clock::advance_system_ms(5999);
    tee_host::clock::advance_ree_ms(-123);
    TEE_Time sys3{}, ree3{};
    TEE_GetSystemTime(&sys3);
    TEE_GetREETime(&ree3);
    EXPECT_EQ(uint64_t{sys3.seconds} * 1000 + sys3.millis, uint64_t{sys1.seconds} * 1000 + sys1.millis + 5999);
    EXPECT_EQ(ree3.seconds, 1700000000u);
    EXPECT_EQ(ree3.millis, 0u);

    EXPECT_EQ(TEE_Wait(1000), TEE_SUCCESS);
    EXPECT_EQ(tee_host::clock::system_ms(), uint64_t{sys3.seconds} * 1000 + sys3.millis + 1000);
    tee_host::clock::unfreeze();
    EXPECT_GE(tee_host::clock::system_ms(), uint64_t{sys3.seconds} * 1000 + sys3.millis + 1000);
}

TEST_F(Platform, ScriptedRandomBytesComeFirst) {
    tee_host::rng::script({1, 2, 3});
    tee_host::rng::script({4});
    uint8_t buf[6] = {};
    TEE_GenerateRandom(buf, 2);
    EXPECT_EQ(buf[0], 1);
    EXPECT_EQ(buf[1], 2);
    EXPECT_EQ(tee_host::rng::scripted_left(), 2u);
    TEE_GenerateRandom(buf, 6);
    EXPECT_EQ(buf[0], 3);
    EXPECT_EQ(buf[1], 4);
    EXPECT_EQ(tee_host::rng::scripted_left(), 0u);
    uint8_t a[16] = {}, b[16] = {};
    TEE_GenerateRandom(a, 16);
    TEE_GenerateRandom(b, 16);
    EXPECT_NE(std::memcmp(a, b, 16), 0);
}

TEST_F(Platform, BootSeedAndRpmbFollowThePlatform) {
    uint8_t seed[32] = {};
    ASSERT_EQ(TEE_GetBootSeed(seed, 32), TEE_SUCCESS);
    EXPECT_EQ(Bytes(seed, seed + 32), tee_->boot_seed());
    EXPECT_EQ(TEE_GetBootSeed(seed, 31), TEE_ERROR_BAD_PARAMETERS);
    uint32_t status = 7;
    EXPECT_EQ(TEE_RPMB_MakeFileSystem(&status), TEE_SUCCESS);
    EXPECT_EQ(status, 0u);
    tee_->set_rpmb_usable(false);
    EXPECT_NE(TEE_RPMB_MakeFileSystem(&status), TEE_SUCCESS);
    EXPECT_NE(status, 0u);
}

// --- Properties ----------------------------------------------------------------

TEST_F(Platform, PropertiesOfTheTaTheClientAndTheTee) {
    TEE_UUID app = {0xabcdef01, 0x2345, 0x6789, {1, 2, 3, 4, 5, 6, 7, 8}};
    uint32_t s = open_probe(tee_host::ta_identity(app));
    Bytes id(20);
    TEE_Param p[4] = {};
    p[2].memref.buffer = id.data();
    p[2].memref.size = 20;
    ASSERT_EQ(tee_->invoke(s, PROBE_CLIENT_IDENTITY, 0x0600, p), TEE_SUCCESS);
    TEE_Identity got{};
    std::memcpy(&got, id.data(), 20);
    EXPECT_EQ(got.login, TEE_LOGIN_TRUSTED_APP);
    EXPECT_EQ(std::memcmp(&got.uuid, &app, sizeof app), 0);
    EXPECT_EQ(property(s, "client", "gpd.client.identity"), "4026531840:abcdef01-2345-6789-0102-030405060708");

    EXPECT_EQ(property(s, "ta", "gpd.ta.appID"), "7a3c5e11-2f4b-4c8d-a16e-903b5d27c401");
    EXPECT_EQ(property(s, "tee", "gpd.tee.trustedos.manufacturer"), tee_->config().os_manufacturer);
    EXPECT_EQ(property(s, "tee", "gpd.tee.trustedos.implementation.version"), tee_->config().os_version);
    std::string device = property(s, "tee", "gpd.tee.deviceID");
    EXPECT_EQ(device.size(), 36u);
    TEE_Result res = TEE_SUCCESS;
    property(s, "tee", "gpd.tee.no.such.thing", &res);
    EXPECT_EQ(res, TEE_ERROR_ITEM_NOT_FOUND);
    tee_->close_session(s);
}

TEST(PlatformProperties, TaPropertiesComeFromItsHeader) {
    tee_host::Tee tee;
    tee.install_ta(&kProbeWithProps);
    EXPECT_EQ(tee_host::heap::stats().limit, kProbeData);
    uint32_t s = 0;
    ASSERT_EQ(tee.open_session(kProbeUuid, tee_host::normal_world_identity(), 0, nullptr, &s), TEE_SUCCESS);
    std::string in = std::string("ta") + '\0' + "gpd.ta.description" + '\0';
    char out[32] = {};
    TEE_Param p[4] = {};
    p[1].memref.buffer = in.data();
    p[1].memref.size = static_cast<uint32_t>(in.size());
    p[2].memref.buffer = out;
    p[2].memref.size = 3; // too small: the needed size comes back
    EXPECT_EQ(tee.invoke(s, PROBE_PROPERTY_STRING, 0x0650, p), TEE_ERROR_SHORT_BUFFER);
    EXPECT_EQ(p[2].memref.size, 6u);
    p[2].memref.size = sizeof out;
    ASSERT_EQ(tee.invoke(s, PROBE_PROPERTY_STRING, 0x0650, p), TEE_SUCCESS);
    EXPECT_STREQ(out, "probe");
}

TEST_F(Platform, DeviceIdIsKeptPerStateDirectory) {
    uint32_t s = open_probe(tee_host::normal_world_identity());
    std::string first = property(s, "tee", "gpd.tee.deviceID");
    tee_->close_session(s);
    stop();
    start();
    tee_->install_ta(&kProbeHeader);
    s = open_probe(tee_host::normal_world_identity());
    EXPECT_EQ(property(s, "tee", "gpd.tee.deviceID"), first);
    tee_->close_session(s);

    ScratchDir other_dir("km-other");
    stop();
    tee_host::Config other;
    other.state_dir = other_dir.path();
    start(other);
    tee_->install_ta(&kProbeHeader);
    s = open_probe(tee_host::normal_world_identity());
    EXPECT_NE(property(s, "tee", "gpd.tee.deviceID"), first);
    tee_->close_session(s);
    stop();
    start();
}

// --- Sessions and TA-to-TA calls -------------------------------------------------

TEST_F(Platform, CreateFailureFailsTheOpenAndDestroyFollowsTheLastClose) {
    g_create_result = TEE_ERROR_OUT_OF_MEMORY;
    uint32_t s = 0;
    EXPECT_EQ(tee_->open_session(kProbeUuid, tee_host::normal_world_identity(), 0, nullptr, &s),
              TEE_ERROR_OUT_OF_MEMORY);
    EXPECT_FALSE(tee_->instance_alive(kProbeUuid));
    EXPECT_EQ(g_destroys.load(), 0);
    g_create_result = TEE_SUCCESS;
    uint32_t a = open_probe(tee_host::normal_world_identity());
    uint32_t b = open_probe(tee_host::normal_world_identity());
    EXPECT_EQ(g_creates.load(), 2);
    tee_->close_session(a);
    EXPECT_EQ(g_destroys.load(), 0);
    tee_->close_session(b);
    EXPECT_EQ(g_destroys.load(), 1);
    EXPECT_FALSE(tee_->instance_alive(kProbeUuid));
    TEE_UUID nobody = {1, 2, 3, {4}};
    EXPECT_EQ(tee_->open_session(nobody, tee_host::normal_world_identity(), 0, nullptr, &s), TEE_ERROR_ITEM_NOT_FOUND);
}

TEST_F(Platform, OneEntryPointCallAtATimePerInstance) {
    g_max_inside = 0;
    constexpr int kThreads = 4;
    std::vector<uint32_t> sessions;
    for (int i = 0; i < kThreads; ++i)
        sessions.push_back(open_probe(tee_host::normal_world_identity()));
    std::vector<std::thread> threads;
    for (int i = 0; i < kThreads; ++i)
        threads.emplace_back([&, s = sessions[i]] {
            for (int n = 0; n < 10; ++n)
                tee_->invoke(s, PROBE_SLOW, 0, nullptr);
        });
    for (auto &t : threads)
        t.join();
    EXPECT_EQ(g_max_inside.load(), 1);
    for (uint32_t s : sessions)
        tee_->close_session(s);
}

TEST_F(Platform, TaToTaSessionsCarryTheCallersIdentity) {
    // The probe carries the first trusted client's UUID, so command 27 gets
    // past the access check to its type and handler checks.
    uint32_t s = open_probe(tee_host::normal_world_identity());
    Bytes blob(8, 0);
    TEE_Param p[4] = {};
    p[1].memref.buffer = blob.data();
    p[1].memref.size = 8;
    ASSERT_EQ(tee_->invoke(s, PROBE_CALL_KEYMASTER, 0x0053, p), TEE_SUCCESS);
    EXPECT_NE(p[0].value.a, TEE_ERROR_SECURITY);
    EXPECT_EQ(p[0].value.b, 4u);
    EXPECT_FALSE(logged_message("Access denied"));
    tee_->close_session(s);
    EXPECT_EQ(tee_->open_sessions(), 1u); // only the fixture's own session is left
}

} // namespace
