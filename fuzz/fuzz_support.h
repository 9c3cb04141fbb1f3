/*
 * fuzz_support.h - what the harnesses share: the one emulated TEE of a
 * fuzz process with the Keymaster TA installed, brought back to the same
 * state before every input; a reader of fuzz input; and the check that
 * turns a broken property into a finding (an abort libFuzzer records).
 */
#ifndef FUZZ_SUPPORT_H
#define FUZZ_SUPPORT_H

#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "ta_calls.h"
#include "tee_host.h"

// fuzz_finding - reports a broken property on stderr and aborts.
[[noreturn]] void fuzz_finding(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

#define FUZZ_CHECK(cond, ...)                                                                                          \
    do {                                                                                                               \
        if (!(cond))                                                                                                   \
            fuzz_finding(__VA_ARGS__);                                                                                 \
    } while (0)

// FuzzInput - reads a fuzz input from the front; once it is used up every
// read gives zeros (or nothing), so a harness never runs past its data.
class FuzzInput {
  public:
    FuzzInput(const uint8_t *data, size_t size) : p_(data), left_(size) {}
    bool empty() const { return left_ == 0; }
    size_t left() const { return left_; }
    uint8_t u8() { return static_cast<uint8_t>(take(1)); }
    uint16_t u16() { return static_cast<uint16_t>(take(2)); }
    uint32_t u32() { return static_cast<uint32_t>(take(4)); }
    uint64_t u64() { return take(8); }
    bool flag() { return u8() & 1; }
    // below - a choice among n (n > 0).
    uint32_t below(uint32_t n) { return n <= 256 ? u8() % n : u16() % n; }
    // bytes - the next n bytes, fewer when the input ends first.
    Bytes bytes(size_t n);
    // lv - a u16 length (cut to max) and that many bytes.
    Bytes lv(size_t max) { return bytes(u16() % (max + 1)); }
    // rest - everything left.
    Bytes rest() { return bytes(left_); }

  private:
    uint64_t take(size_t n);
    const uint8_t *p_;
    size_t left_;
};

// FuzzTee - the process's emulated TEE, on a provisioned device (SOTER
// material in the factory store) in a state directory of its own: the
// KM_FUZZ_STATE directory when set (scripts/fuzz.sh puts it under
// build/), else a temporary one. Trace lines are formatted (so format
// errors show) but printed only up to the level KM_FUZZ_TRACE names; by
// default none.
class FuzzTee {
  public:
    // instance - started on first use, with a normal-world session and a
    // trusted-TA session open on a live TA instance.
    static FuzzTee &instance();

    uint32_t session() const { return session_; }
    uint32_t trusted_session() const { return trusted_; }
    TEE_Result invoke(uint32_t session, uint32_t command, Params &p) {
        return tee_->invoke(session, command, p.types, p.p);
    }
    tee_host::Tee &tee() { return *tee_; }
    const std::filesystem::path &state_dir() const { return dir_; }

    // settle - what the state directory holds now (keys made for the
    // harness, the SOTER counter) is what every reset brings back.
    void settle();

    // reset - ends the TA instance and starts a fresh one (empty operation
    // pool, use log and token cache), with the random source scripted to
    // the same bytes (so operation handles and blob randomness repeat),
    // the REE clock at the same time, no armed allocation failure, and the
    // state directory as settle() left it. A finding when the ended
    // instance left TA heap blocks or TEE handles behind.
    void reset();

    ~FuzzTee();

  private:
    FuzzTee();
    void start_tee();
    void open_sessions();
    void close_sessions();
    std::filesystem::path dir_;
    bool own_dir_ = false;
    std::unique_ptr<tee_host::Tee> tee_;
    uint32_t session_ = 0;
    uint32_t trusted_ = 0;
    struct FileState {
        uint64_t ino, size;
        int64_t mtime_ns;
        Bytes bytes;
    };
    std::map<std::filesystem::path, FileState> settled_;
};

// HeapScope - the TA heap as a codec harness found it: a finding when the
// input leaves more live blocks than it began with.
class HeapScope {
  public:
    HeapScope() : live_(tee_host::heap::stats().live_count) {}
    ~HeapScope();
    HeapScope(const HeapScope &) = delete;
    HeapScope &operator=(const HeapScope &) = delete;

  private:
    size_t live_;
};

#endif
