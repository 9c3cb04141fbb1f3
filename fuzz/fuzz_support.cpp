/*
 * fuzz_support.cpp - the harnesses' TEE, its reset between inputs, and
 * the input reader.
 */
#include "fuzz_support.h"

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "rsa_keys.h"
#include "soter_keys.h"
#include "ta_entry.h"

namespace fs = std::filesystem;

namespace {

// The fingerprint TA the factory store names.
constexpr TEE_UUID kFingerprintTa = {0x0fb1c2d3, 0x4e5f, 0x4a6b, {0x9c, 0x8d, 0x7e, 0x6f, 0x50, 0x41, 0x32, 0x23}};
// Where every input finds the REE clock: 2021-01-01T00:00:00Z.
constexpr uint64_t kReeEpochMs = 1609459200000ull;
// Bytes scripted into the random source per input: enough for every blob
// and handle a long input makes.
constexpr size_t kScriptedRandom = 8192;
// The longest the harness lets the TEE run before it boots again: 30 days.
constexpr uint64_t kMaxUptimeMs = 30ull * 24 * 3600 * 1000;

void provision(const fs::path &dir) {
    tee_host::provisioning::FactoryData d = factory_key(kRsa2048Pem);
    d.sensor_name = "fuzz-sensor";
    d.sensor_version = "1.0";
    d.fp_ta_uuid = kFingerprintTa;
    d.cpu_id = "fuzz-cpu-0";
    if (tee_host::provisioning::store(dir, d, true) != tee_host::provisioning::StoreResult::stored)
        fuzz_finding("cannot provision the fuzz state directory %s", dir.c_str());
}

int trace_level_from_env() {
    const char *v = std::getenv("KM_FUZZ_TRACE");
    return v ? std::atoi(v) : 0;
}

// The same pseudo-random bytes for every input (xorshift64*).
const Bytes &scripted_random() {
    static const Bytes bytes = [] {
        Bytes b(kScriptedRandom);
        uint64_t x = 0x9E3779B97F4A7C15ull;
        for (auto &v : b) {
            x ^= x >> 12;
            x ^= x << 25;
            x ^= x >> 27;
            v = static_cast<uint8_t>((x * 0x2545F4914F6CDD1Dull) >> 56);
        }
        return b;
    }();
    return bytes;
}

bool stat_file(const fs::path &p, struct stat *st) {
    return ::stat(p.c_str(), st) == 0;
}

int64_t mtime_ns(const struct stat &st) {
    return int64_t{st.st_mtim.tv_sec} * 1000000000 + st.st_mtim.tv_nsec;
}

Bytes read_all(const fs::path &p) {
    std::ifstream in(p, std::ios::binary);
    return Bytes(std::istreambuf_iterator<char>(in), {});
}

} // namespace

void fuzz_finding(const char *fmt, ...) {
    std::va_list ap;
    va_start(ap, fmt);
    std::fputs("FUZZ FINDING: ", stderr);
    std::vfprintf(stderr, fmt, ap);
    std::fputs("\n", stderr);
    va_end(ap);
    std::fflush(stderr);
    std::abort();
}

Bytes FuzzInput::bytes(size_t n) {
    if (n > left_)
        n = left_;
    Bytes b(p_, p_ + n);
    p_ += n;
    left_ -= n;
    return b;
}

uint64_t FuzzInput::take(size_t n) {
    uint64_t v = 0;
    for (size_t i = 0; i < n && left_; ++i, ++p_, --left_)
        v |= uint64_t{*p_} << (8 * i);
    return v;
}

FuzzTee &FuzzTee::instance() {
    static FuzzTee tee;
    return tee;
}

FuzzTee::FuzzTee() {
    if (const char *d = std::getenv("KM_FUZZ_STATE"); d && *d) {
        // One device per process: -jobs runs several harness processes at once.
        dir_ = fs::path(d) / ("pid-" + std::to_string(getpid()));
        std::error_code ec;
        fs::remove_all(dir_, ec); // a run starts on a fresh device
        fs::create_directories(dir_);
    } else {
        std::string tmpl = (fs::temp_directory_path() / "km-fuzz-XXXXXX").string();
        if (!mkdtemp(tmpl.data()))
            fuzz_finding("cannot create a state directory");
        dir_ = tmpl;
        own_dir_ = true;
    }
    provision(dir_);
    start_tee();
    settle();
}

void FuzzTee::start_tee() {
    tee_.reset();
    tee_host::Config config;
    config.state_dir = dir_;
    config.trace_level = trace_level_from_env();
    tee_ = std::make_unique<tee_host::Tee>(config);
    tee_->install_ta(&keymaster_ta_header);
    tee_host::clock::freeze();
    tee_host::clock::set_ree_ms(kReeEpochMs);
    // Every line is formatted and kept until the next reset: format errors
    // in the TA's trace calls show up, and nothing reaches stderr.
    tee_host::trace::capture(true);
    open_sessions();
}

FuzzTee::~FuzzTee() {
    close_sessions();
    tee_.reset();
    if (own_dir_) {
        std::error_code ec;
        fs::remove_all(dir_, ec);
    }
}

void FuzzTee::open_sessions() {
    TEE_Result res = tee_->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session_);
    FUZZ_CHECK(res == TEE_SUCCESS, "the TA instance does not start: 0x%08x", res);
    res = tee_->open_session(keymaster_ta_uuid, tee_host::ta_identity(trusted_client_uuids[1]), 0, nullptr, &trusted_);
    FUZZ_CHECK(res == TEE_SUCCESS, "a trusted TA cannot open a session: 0x%08x", res);
}

void FuzzTee::close_sessions() {
    if (trusted_)
        tee_->close_session(trusted_);
    if (session_)
        tee_->close_session(session_);
    trusted_ = session_ = 0;
}

void FuzzTee::settle() {
    settled_.clear();
    for (const auto &e : fs::recursive_directory_iterator(dir_)) {
        struct stat st {};
        if (!e.is_regular_file() || !stat_file(e.path(), &st))
            continue;
        settled_[e.path()] = FileState{st.st_ino, static_cast<uint64_t>(st.st_size), mtime_ns(st), read_all(e.path())};
    }
}

void FuzzTee::reset() {
    close_sessions();
    for (const auto &a : tee_host::heap::leaks_at_last_destroy())
        fuzz_finding("TA heap leak: %zu bytes allocated at %s:%d", a.size, a.file.c_str(), a.line);
    FUZZ_CHECK(tee_host::handles::leaked_at_last_destroy() == 0, "the TA instance left %zu TEE handles open",
               tee_host::handles::leaked_at_last_destroy());
    FUZZ_CHECK(tee_host::heap::stats().live_count == 0, "%zu TA heap blocks outlive the instance",
               tee_host::heap::stats().live_count);
    tee_host::heap::fail_nth(0);
    tee_host::provisioning::reset();

    // The state directory back as settled: files the input made go, files
    // it changed (the SOTER counter) come back.
    bool changed = false;
    std::vector<fs::path> extra;
    size_t seen = 0;
    for (const auto &e : fs::recursive_directory_iterator(dir_)) {
        if (!e.is_regular_file())
            continue;
        auto it = settled_.find(e.path());
        struct stat st {};
        if (it == settled_.end()) {
            extra.push_back(e.path());
            continue;
        }
        ++seen;
        if (!stat_file(e.path(), &st) || st.st_ino != it->second.ino ||
            static_cast<uint64_t>(st.st_size) != it->second.size || mtime_ns(st) != it->second.mtime_ns)
            changed = true;
    }
    std::error_code ec;
    for (const auto &p : extra)
        fs::remove(p, ec);
    if (changed || seen != settled_.size()) {
        for (auto &[path, state] : settled_) {
            {
                std::ofstream out(path, std::ios::binary | std::ios::trunc);
                out.write(reinterpret_cast<const char *>(state.bytes.data()),
                          static_cast<std::streamsize>(state.bytes.size()));
            }
            struct stat st {};
            if (stat_file(path, &st)) {
                state.ino = st.st_ino;
                state.mtime_ns = mtime_ns(st);
            }
        }
    }

    // Scripted bytes left over from the last input are used up first.
    for (size_t left = tee_host::rng::scripted_left(); left; left = tee_host::rng::scripted_left()) {
        uint8_t sink[64];
        TEE_GenerateRandom(sink, static_cast<uint32_t>(left < sizeof sink ? left : sizeof sink));
    }
    // Inputs move the system clock forward only; a new boot brings it back
    // long before its seconds could wrap.
    if (tee_host::clock::system_ms() > kMaxUptimeMs) {
        start_tee();
        close_sessions();
    }
    tee_host::rng::script(scripted_random());
    tee_host::clock::set_ree_ms(kReeEpochMs);
    tee_host::trace::clear();
    open_sessions();
}

HeapScope::~HeapScope() {
    const size_t now = tee_host::heap::stats().live_count;
    if (now > live_) {
        for (const auto &a : tee_host::heap::live())
            std::fprintf(stderr, "live: %zu bytes allocated at %s:%d\n", a.size, a.file.c_str(), a.line);
        fuzz_finding("%zu TA heap blocks leaked", now - live_);
    }
    tee_host::trace::clear();
}
