/*
 * trace.cpp - the TEE trace facility: "LVL IDENT:func:line: text" lines,
 * cut to 256 bytes, written to stderr up to a level and kept for tests.
 */
#include <cstdarg>
#include <cstdio>
#include <functional>
#include <mutex>
#include <thread>

#include "platform_internal.h"

namespace tee_host {
namespace {

constexpr size_t kMaxLine = 256;

struct TraceState {
    std::mutex mu;
    int level = TEE_TRACE_ERROR;
    bool thread_ids = false;
    bool capturing = false;
    std::vector<trace::Line> lines;
};

TraceState &state() {
    static TraceState s;
    return s;
}

const char *level_name(int level) {
    switch (level) {
    case TEE_TRACE_ERROR:
        return "ERR";
    case TEE_TRACE_INFO:
        return "INF";
    case TEE_TRACE_DEBUG:
        return "DBG";
    case TEE_TRACE_FLOW:
        return "FLW";
    default:
        return "???";
    }
}

} // namespace

namespace trace {
void set_level(int level) {
    std::lock_guard<std::mutex> lock(state().mu);
    state().level = level;
}
int level() {
    std::lock_guard<std::mutex> lock(state().mu);
    return state().level;
}
void capture(bool on) {
    std::lock_guard<std::mutex> lock(state().mu);
    state().capturing = on;
    if (on)
        state().lines.clear();
}
std::vector<Line> captured() {
    std::lock_guard<std::mutex> lock(state().mu);
    return state().lines;
}
void clear() {
    std::lock_guard<std::mutex> lock(state().mu);
    state().lines.clear();
}
} // namespace trace

namespace detail {
void trace_reset(int level, bool thread_ids) {
    std::lock_guard<std::mutex> lock(state().mu);
    state().level = level;
    state().thread_ids = thread_ids;
    state().capturing = false;
    state().lines.clear();
}
} // namespace detail
} // namespace tee_host

using namespace tee_host;

extern "C" void TEE_Trace(int level, const char *ident, const char *func, int line, const char *fmt, ...) {
    TraceState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (!s.capturing && level > s.level)
        return;

    char buf[kMaxLine + 1] = {};
    int head = 0;
    if (s.thread_ids) {
        unsigned tid = static_cast<unsigned>(std::hash<std::thread::id>{}(std::this_thread::get_id()) & 0xFFFF);
        head = std::snprintf(buf, sizeof buf, "%s [0x%x] %s:%s:%d: ", level_name(level), tid, ident, func, line);
    } else {
        head = std::snprintf(buf, sizeof buf, "%s %s:%s:%d: ", level_name(level), ident, func, line);
    }
    if (head < 0)
        return;
    size_t used = static_cast<size_t>(head) < kMaxLine - 1 ? static_cast<size_t>(head) : kMaxLine - 1;

    std::va_list ap;
    va_start(ap, fmt);
    char msg[1024] = {};
    std::vsnprintf(msg, sizeof msg, fmt, ap);
    va_end(ap);
    std::string message(msg);
    while (!message.empty() && message.back() == '\n')
        message.pop_back();

    // The whole line, newline included, stays within kMaxLine bytes.
    std::string formatted(buf, used);
    size_t room = kMaxLine - 1 - formatted.size();
    formatted += message.substr(0, room);
    formatted += '\n';

    if (level <= s.level) {
        std::fputs(formatted.c_str(), stderr);
    }
    if (s.capturing)
        s.lines.push_back(trace::Line{level, func, line, message, formatted});
}
