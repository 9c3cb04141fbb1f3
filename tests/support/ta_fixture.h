/*
 * ta_fixture.h - a live emulated TEE with the Keymaster TA installed, a
 * normal-world session open and the trace captured. Commands are driven
 * with the real TEE_Param arrays of ta_calls.h.
 */
#ifndef TA_FIXTURE_H
#define TA_FIXTURE_H

#include <cstdint>
#include <functional>
#include <initializer_list>
#include <memory>
#include <optional>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include <gtest/gtest.h>

#include "scratch_dir.h"
#include "ta_calls.h"
#include "tee_host.h"

// A bare emulated TEE with no TA installed, on a fresh state directory,
// for tests of the platform's own services. Ends with no live handle.
class TeeTest : public ::testing::Test {
  protected:
    void SetUp() override;
    void TearDown() override;
    // restart - a new Tee on the same state directory.
    void restart();
    // Declared first, so that the directory goes after the Tee using it.
    ScratchDir scratch_{"tee-test"};
    const std::filesystem::path &dir_ = scratch_.path();
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
    // logged_count - how many captured lines carry this message (or, with prefix, start with it).
    int logged_count(std::string_view message, bool prefix = false) const;
    std::string dump_log() const;

    // extra_allocations - live TA heap blocks beyond what the TA instance
    // itself holds between commands (its use log and token cache).
    size_t extra_allocations() const { return tee_host::heap::stats().live_count - baseline_live_; }

    // Made by SetUp: a TaTest driven without it (in a child) leaves no directory behind.
    std::optional<ScratchDir> scratch_;
    std::filesystem::path state_dir_;
    std::unique_ptr<tee_host::Tee> tee_;
    size_t baseline_live_ = 0;
    uint32_t session_ = 0;
};

// sweep_allocations - fails the 1st, 2nd, ... TA heap allocation of `step`
// in turn (after `setup`, which may be null) until a run fires no failure.
// Every run whose failure fired must end in one of `allowed`, and with as
// many live TA heap blocks as before the sweep: step, or `cleanup` (run
// with no failure armed, may be null), ends whatever step and setup began.
// Reports each violation with `what` and the failure point; returns the
// number of failure points visited.
int sweep_allocations(const std::string &what, const std::function<void()> &setup, const std::function<Outcome()> &step,
                      const std::vector<Outcome> &allowed, const std::function<void()> &cleanup = nullptr);

Bytes hex(std::string_view s);

// concat - the parts one after another.
Bytes concat(std::initializer_list<Bytes> parts);

#endif
