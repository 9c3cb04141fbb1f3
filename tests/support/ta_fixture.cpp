/*
 * ta_fixture.cpp - the test harness around the emulated TEE.
 */
#include "ta_fixture.h"

#include <cstdio>
#include <sstream>

#include "ta_entry.h"

void TeeTest::SetUp() {
    restart();
}

void TeeTest::restart() {
    tee_.reset();
    tee_host::Config config;
    config.state_dir = dir_;
    config.trace_level = 0;
    tee_ = std::make_unique<tee_host::Tee>(config);
}

void TeeTest::TearDown() {
    EXPECT_EQ(tee_host::handles::live_operations(), 0u);
    EXPECT_EQ(tee_host::handles::live_objects(), 0u);
    tee_.reset();
}

void TaTest::SetUp() {
    state_dir_ = scratch_.emplace("km-test").path();
    tee_host::Config config;
    config.state_dir = state_dir_;
    start(config);
}

void TaTest::start(tee_host::Config config) {
    if (config.state_dir.empty())
        config.state_dir = state_dir_;
    config.trace_level = 0;
    tee_ = std::make_unique<tee_host::Tee>(config);
    tee_->install_ta(&keymaster_ta_header);
    tee_host::trace::capture(true);
    session_ = open();
    baseline_live_ = tee_host::heap::stats().live_count;
}

void TaTest::stop() {
    tee_.reset();
    session_ = 0;
}

void TaTest::TearDown() {
    if (tee_) {
        tee_->close_session(session_);
        // Any other sessions a test left open close with the Tee.
        stop();
    }
    EXPECT_EQ(tee_host::heap::stats().live_count, 0u) << "TA heap allocations still live";
    EXPECT_EQ(tee_host::handles::live_objects(), 0u) << "TEE objects still open";
    EXPECT_EQ(tee_host::handles::live_operations(), 0u) << "TEE operations still allocated";
    EXPECT_EQ(tee_host::handles::leaked_at_last_destroy(), 0u) << "TEE handles left to the instance teardown";
    for (const auto &a : tee_host::heap::leaks_at_last_destroy())
        ADD_FAILURE() << "leaked " << a.size << " bytes allocated at " << a.file << ":" << a.line;
}

uint32_t TaTest::open(const TEE_UUID *ta_client) {
    TEE_Identity id = ta_client ? tee_host::ta_identity(*ta_client) : tee_host::normal_world_identity();
    uint32_t s = 0;
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, id, 0, nullptr, &s);
    EXPECT_EQ(res, TEE_SUCCESS);
    return s;
}

TEE_Result TaTest::invoke_on(uint32_t session, uint32_t cmd, Params &p) {
    return tee_->invoke(session, cmd, p.types, p.p);
}

bool TaTest::logged(int level, std::string_view func, std::string_view message) const {
    for (const auto &l : tee_host::trace::captured())
        if (l.level == level && l.func == func && l.message == message)
            return true;
    return false;
}

bool TaTest::logged_message(std::string_view message) const {
    for (const auto &l : tee_host::trace::captured())
        if (l.message == message)
            return true;
    return false;
}

int TaTest::logged_count(std::string_view message, bool prefix) const {
    int n = 0;
    for (const auto &l : tee_host::trace::captured())
        n += prefix ? std::string_view(l.message).substr(0, message.size()) == message : l.message == message;
    return n;
}

std::string TaTest::dump_log() const {
    std::string s;
    for (const auto &l : tee_host::trace::captured())
        s += l.formatted;
    return s;
}

int sweep_allocations(const std::string &what, const std::function<void()> &setup, const std::function<Outcome()> &step,
                      const std::vector<Outcome> &allowed, const std::function<void()> &cleanup) {
    const size_t base = tee_host::heap::stats().live_count;
    for (int n = 1;; ++n) {
        if (setup)
            setup();
        tee_host::heap::fail_nth(static_cast<uint64_t>(n));
        const Outcome o = step();
        const bool fired = tee_host::heap::injected_failure_fired();
        tee_host::heap::fail_nth(0);
        if (cleanup)
            cleanup();
        if (!fired)
            return n - 1;
        bool expected = false;
        for (const Outcome &a : allowed)
            expected = expected || a == o;
        EXPECT_TRUE(expected) << what << ": failure point " << n << " ended in " << o;
        EXPECT_EQ(tee_host::heap::stats().live_count, base) << what << ": failure point " << n << " leaked";
        if (n > 10000) {
            ADD_FAILURE() << what << ": allocation sweep does not end";
            return n;
        }
    }
}

Bytes concat(std::initializer_list<Bytes> parts) {
    Bytes out;
    for (const Bytes &p : parts)
        out.insert(out.end(), p.begin(), p.end());
    return out;
}

Bytes hex(std::string_view s) {
    Bytes out;
    int hi = -1;
    for (char c : s) {
        int v = -1;
        if (c >= '0' && c <= '9')
            v = c - '0';
        else if (c >= 'a' && c <= 'f')
            v = c - 'a' + 10;
        else if (c >= 'A' && c <= 'F')
            v = c - 'A' + 10;
        if (v < 0)
            continue;
        if (hi < 0) {
            hi = v;
        } else {
            out.push_back(static_cast<uint8_t>(hi << 4 | v));
            hi = -1;
        }
    }
    return out;
}
