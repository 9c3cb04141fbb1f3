/*
 * ta_fixture.h - a live emulated TEE with the Keymaster TA installed, a
 * normal-world session open and the trace captured; and helpers to drive
 * commands with real TEE_Param arrays.
 */
#ifndef TA_FIXTURE_H
#define TA_FIXTURE_H

#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include <gtest/gtest.h>

#include "tee_host.h"

using Bytes = std::vector<uint8_t>;

// A command's parameters as the normal world would pass them.
struct Params {
    uint32_t types = 0;
    TEE_Param p[4] = {};

    static Params value(uint32_t a = 0, uint32_t b = 0);
    // value in params[0], optional input in params[1], output capacity in params[2].
    static Params io(uint32_t a, uint32_t b, Bytes *in, Bytes *out);
};

// A bare emulated TEE with no TA installed, on a fresh state directory,
// for tests of the platform's own services. Ends with no live handle.
class TeeTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;
    // restart - a new Tee on the same state directory.
    void restart();
    std::filesystem::path dir_;
    std::unique_ptr<tee_host::Tee> tee_;
};

class TaTest : public ::testing::Test {
protected:
    void SetUp() override;
    void TearDown() override;

    // start / stop - the Tee (and its TA instance) on their own, for restart tests.
    void start(tee_host::Config config = {});
    void stop();

    // open - another session; a TA client when uuid is given.
    uint32_t open(const TEE_UUID *ta_client = nullptr);
    TEE_Result invoke(uint32_t cmd, Params &p) { return invoke_on(session_, cmd, p); }
    TEE_Result invoke_on(uint32_t session, uint32_t cmd, Params &p);

    // logged - whether a captured line has this level, function and message.
    bool logged(int level, std::string_view func, std::string_view message) const;
    bool logged_message(std::string_view message) const;
    std::string dump_log() const;

    // extra_allocations - live TA heap blocks beyond what the TA instance
    // itself holds between commands (its use log and token cache).
    size_t extra_allocations() const { return tee_host::heap::stats().live_count - baseline_live_; }

    std::unique_ptr<tee_host::Tee> tee_;
    size_t baseline_live_ = 0;
    std::filesystem::path state_dir_;
    uint32_t session_ = 0;
};

// sweep_allocations - runs `step` with the 1st, 2nd, ... allocation failing
// until a run fires no failure; `check` sees each failed run's outcome.
// Returns the number of failure points visited.
int sweep_allocations(const std::function<void()> &setup, const std::function<TEE_Result()> &step,
                      const std::function<void(int n, TEE_Result res)> &check);

Bytes hex(std::string_view s);
std::string to_hex(const uint8_t *p, size_t n);
inline std::string to_hex(const Bytes &b) { return to_hex(b.data(), b.size()); }

#endif
