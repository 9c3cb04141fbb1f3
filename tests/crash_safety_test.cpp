/*
 * Crash safety of what the TEE keeps: a child process loses power at each
 * step of the atomic write behind the key-store key, the SOTER counter and
 * the factory store; the state it leaves holds the old value or the new
 * one, never a torn or missing one, and the TA starts on it.
 */
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <functional>
#include <string>

#include <gtest/gtest.h>

#include "key_commands.h"
#include "keymaster_defs.h"
#include "rsa_keys.h"
#include "soter_keys.h"
#include "ta_entry.h"
#include "scratch_dir.h"

namespace {

namespace fs = std::filesystem;
namespace crash = tee_host::crash;
namespace prov = tee_host::provisioning;
using km::ParamSet;

constexpr crash::Point kPoints[] = {crash::Point::partial_write, crash::Point::written, crash::Point::synced,
                                    crash::Point::renamed};
const char *name(crash::Point p) {
    switch (p) {
    case crash::Point::partial_write:
        return "partial write";
    case crash::Point::written:
        return "written";
    case crash::Point::synced:
        return "synced";
    default:
        return "renamed";
    }
}

// A TEE on a state directory with the Keymaster TA and one session, for
// driving commands outside a test fixture (in a child, or between children).
class Device : public KeyTest {
  public:
    explicit Device(const fs::path &dir) {
        tee_host::Config c;
        c.state_dir = dir;
        c.trace_level = 0;
        start(c);
    }
    // ~Device - ends the TEE, checking that nothing was left behind.
    ~Device() override { TearDown(); }
    void TestBody() override {}

    using KeyTest::begin;
    using KeyTest::export_key;
    using KeyTest::finish;
    using KeyTest::generate;
    using KeyTest::hmac_params;
    using KeyTest::import;
    using KeyTest::invoke;
    using KeyTest::run;
    using KeyTest::update;
};

// The 8 counter bytes as stored, or what there is instead.
Bytes counter_object() {
    static const char id[] = "SOTER_COUNTER_OBJECT";
    TEE_ObjectHandle obj = TEE_HANDLE_NULL;
    if (TEE_OpenPersistentObject(TEE_STORAGE_PRIVATE, id, sizeof id, TEE_DATA_FLAG_ACCESS_READ, &obj) != TEE_SUCCESS)
        return {};
    Bytes data(16, 0);
    uint32_t n = 0;
    TEE_Result res = TEE_ReadObjectData(obj, data.data(), static_cast<uint32_t>(data.size()), &n);
    TEE_CloseObject(obj);
    data.resize(res == TEE_SUCCESS ? n : 0);
    return data;
}

class CrashSafety : public ::testing::Test {
  protected:
    // in_child - runs body in a child process with a power cut armed at the
    // nth atomic write to reach point; the child's exit status (the cut's
    // code when it happened, 0 when body ran to its end, 1 when it failed).
    int in_child(crash::Point point, uint64_t nth, const std::function<bool()> &body) {
        pid_t pid = ::fork();
        if (pid == 0) {
            crash::die_at(point, nth);
            const bool ok = body();
            ::_exit(ok ? 0 : 1);
        }
        int status = 0;
        ::waitpid(pid, &status, 0);
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    static ParamSet soter_key_params() {
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA).add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        p.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
        p.add_bool(KM_TAG_NO_AUTH_REQUIRED).add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
        p.add_bool(KM_TAG_SOTER_IS_AUTO_SIGNED_WITH_ATTK_WHEN_GET_PUBLIC_KEY);
        p.add_bool(KM_TAG_SOTER_AUTO_ADD_COUNTER_WHEN_GET_PUBLIC_KEY);
        return p;
    }

    ScratchDir scratch_{"crash-safety"};
    const fs::path &dir_ = scratch_.path();
};

// The key-store key is written when the TA first starts on a directory.
TEST_F(CrashSafety, KeyStoreKeyCreation) {
    for (crash::Point p : kPoints) {
        SCOPED_TRACE(name(p));
        scratch_.renew("crash-safety");
        EXPECT_EQ(in_child(p, 1,
                           [&] {
                               Bytes b;
                               return Device(dir_).generate(Device::hmac_params(), &b).ok();
                           }),
                  crash::kExitCode);
        // The TA starts on what is left, and its keys work across restarts.
        Bytes blob;
        {
            Device d(dir_);
            ASSERT_TRUE(d.generate(Device::hmac_params(), &blob).ok());
        }
        Device again(dir_);
        Bytes out;
        EXPECT_TRUE(
            again.run(KM_PURPOSE_SIGN, blob, ParamSet().add(KM_TAG_MAC_LENGTH, 256), Bytes(8, 1), 8, {}, &out).ok());
    }
}

// The SOTER counter is rewritten by every export of a counting key.
TEST_F(CrashSafety, SoterCounterUpdate) {
    prov::FactoryData d = factory_key(kRsa2048Pem);
    d.sensor_name = "s";
    d.sensor_version = "1";
    d.cpu_id = "c";
    ASSERT_EQ(prov::store(dir_, d, false), prov::StoreResult::stored);
    Bytes blob;
    {
        Device dev(dir_);
        ASSERT_TRUE(dev.import(soter_key_params(), rsa_material(kRsa1024Pem), &blob).ok());
        Bytes out;
        ASSERT_TRUE(dev.export_key(key_reference(blob), &out).ok());
        ASSERT_EQ(counter_object(), (Bytes{1, 0, 0, 0, 0, 0, 0, 0}));
    }
    uint64_t last = 1;
    for (crash::Point p : kPoints) {
        SCOPED_TRACE(name(p));
        EXPECT_EQ(in_child(p, 1,
                           [&] {
                               Bytes out;
                               return Device(dir_).export_key(key_reference(blob), &out).ok();
                           }),
                  crash::kExitCode);
        Device dev(dir_);
        const Bytes stored = counter_object();
        ASSERT_EQ(stored.size(), 8u) << "never torn or missing";
        uint64_t value = 0;
        for (int i = 7; i >= 0; --i)
            value = value << 8 | stored[static_cast<size_t>(i)];
        EXPECT_TRUE(value == last || value == last + 1) << value;
        // Until the rename the old value is what a restart finds, after it the new.
        if (p == crash::Point::renamed) {
            EXPECT_EQ(value, last + 1);
        } else {
            EXPECT_EQ(value, last);
        }
        Bytes out;
        ASSERT_TRUE(dev.export_key(key_reference(blob), &out).ok());
        last = value + 1;
        EXPECT_EQ(counter_object(), (Bytes{static_cast<uint8_t>(last), 0, 0, 0, 0, 0, 0, 0}));
    }
}

// The factory store is replaced by a forced provisioning.
TEST_F(CrashSafety, FactoryStoreReplacement) {
    prov::FactoryData first = factory_key(kRsa2048Pem);
    first.sensor_name = "first";
    first.sensor_version = "1";
    first.cpu_id = "cpu-first";
    prov::FactoryData second = first;
    second.sensor_name = "second";
    second.cpu_id = "cpu-second";
    ASSERT_EQ(prov::store(dir_, first, false), prov::StoreResult::stored);
    for (crash::Point p : kPoints) {
        SCOPED_TRACE(name(p));
        EXPECT_EQ(in_child(p, 1, [&] { return prov::store(dir_, second, true) == prov::StoreResult::stored; }),
                  crash::kExitCode);
        // The store is the old one until the rename, the new one after it.
        std::ifstream in(dir_ / "provisioning" / "factory.bin", std::ios::binary);
        const std::string stored((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
        const bool second_stored = stored.find("cpu-second") != std::string::npos;
        EXPECT_NE(second_stored, stored.find("cpu-first") != std::string::npos) << "one of the two, whole";
        EXPECT_EQ(second_stored, p == crash::Point::renamed);
        // And the TA loads it.
        {
            Device dev(dir_);
            Params load = Params::value();
            ASSERT_EQ(dev.invoke(KM_CMD_SOTER_GENERATE_ATTK_KEY_PAIR, load), TEE_SUCCESS);
            EXPECT_EQ(load.p[0].value.a, 0u) << "the SOTER state loads";
        }
        ASSERT_EQ(prov::store(dir_, first, true), prov::StoreResult::stored) << "back to the first for the next point";
    }
}

} // namespace
