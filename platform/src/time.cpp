/*
 * time.cpp - system time (since the platform started) and REE time (the
 * host's wall clock), both of which tests can freeze and move.
 */
#include <chrono>
#include <mutex>
#include <thread>

#include "platform_internal.h"

namespace tee_host {
namespace {

struct ClockState {
    std::mutex mu;
    bool frozen = false;
    std::chrono::steady_clock::time_point start = std::chrono::steady_clock::now();
    int64_t system_offset_ms = 0; // added to the running system clock
    int64_t ree_offset_ms = 0;    // added to the host's wall clock
    uint64_t frozen_system_ms = 0;
    uint64_t frozen_ree_ms = 0;
};

ClockState &state() {
    static ClockState s;
    return s;
}

uint64_t running_system_ms(const ClockState &s) {
    auto d = std::chrono::steady_clock::now() - s.start;
    return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::milliseconds>(d).count() + s.system_offset_ms);
}

uint64_t running_ree_ms(const ClockState &s) {
    auto now = std::chrono::system_clock::now().time_since_epoch();
    return static_cast<uint64_t>(std::chrono::duration_cast<std::chrono::milliseconds>(now).count() + s.ree_offset_ms);
}

uint64_t system_locked(const ClockState &s) {
    return s.frozen ? s.frozen_system_ms : running_system_ms(s);
}
uint64_t ree_locked(const ClockState &s) {
    return s.frozen ? s.frozen_ree_ms : running_ree_ms(s);
}

} // namespace

namespace clock {
void freeze() {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.frozen)
        return;
    s.frozen_system_ms = running_system_ms(s);
    s.frozen_ree_ms = running_ree_ms(s);
    s.frozen = true;
}

void unfreeze() {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (!s.frozen)
        return;
    // Carry on from where the frozen clocks stood.
    s.system_offset_ms += static_cast<int64_t>(s.frozen_system_ms) - static_cast<int64_t>(running_system_ms(s));
    s.ree_offset_ms += static_cast<int64_t>(s.frozen_ree_ms) - static_cast<int64_t>(running_ree_ms(s));
    s.frozen = false;
}

void advance_system_ms(uint64_t ms) {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.frozen)
        s.frozen_system_ms += ms;
    else
        s.system_offset_ms += static_cast<int64_t>(ms);
}

void advance_ree_ms(int64_t ms) {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.frozen)
        s.frozen_ree_ms = static_cast<uint64_t>(static_cast<int64_t>(s.frozen_ree_ms) + ms);
    else
        s.ree_offset_ms += ms;
}

void advance_ms(uint64_t ms) {
    advance_system_ms(ms);
    advance_ree_ms(static_cast<int64_t>(ms));
}

void set_ree_ms(uint64_t ms_since_epoch) {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.frozen)
        s.frozen_ree_ms = ms_since_epoch;
    else
        s.ree_offset_ms += static_cast<int64_t>(ms_since_epoch) - static_cast<int64_t>(running_ree_ms(s));
}

uint64_t system_ms() {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return system_locked(s);
}

uint64_t ree_ms() {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return ree_locked(s);
}
} // namespace clock

namespace detail {
void clock_reset() {
    ClockState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    s.frozen = false;
    s.start = std::chrono::steady_clock::now();
    s.system_offset_ms = 0;
    s.ree_offset_ms = 0;
}
} // namespace detail
} // namespace tee_host

using namespace tee_host;

namespace {
void to_tee_time(uint64_t ms, TEE_Time *t) {
    t->seconds = static_cast<uint32_t>(ms / 1000);
    t->millis = static_cast<uint32_t>(ms % 1000);
}
} // namespace

extern "C" {

void TEE_GetSystemTime(TEE_Time *time) {
    if (!time)
        detail::panic("TEE_GetSystemTime with a null time");
    to_tee_time(clock::system_ms(), time);
}

void TEE_GetREETime(TEE_Time *time) {
    if (!time)
        detail::panic("TEE_GetREETime with a null time");
    to_tee_time(clock::ree_ms(), time);
}

TEE_Result TEE_Wait(uint32_t timeout) {
    ClockState &s = state();
    {
        std::lock_guard<std::mutex> lock(s.mu);
        if (s.frozen) {
            // A frozen clock waits by moving itself.
            s.frozen_system_ms += timeout;
            s.frozen_ree_ms += timeout;
            return TEE_SUCCESS;
        }
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(timeout));
    return TEE_SUCCESS;
}

} // extern "C"
