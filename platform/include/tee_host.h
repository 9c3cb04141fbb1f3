/*
 * tee_host.h - the host side of the emulated TEE: starting it, loading TAs,
 * opening sessions into them, and the controls tests use to drive the
 * platform (clocks, random source, heap failures, trace capture).
 *
 * One Tee lives in a process at a time, because TA state is process-wide
 * as it is on a real TEE. Not for inclusion by TA code.
 */
#ifndef TEE_HOST_H
#define TEE_HOST_H

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "tee_internal_api.h"
#include "tee_ta_header.h"

namespace tee_host {

struct Config {
    // Persistent storage and the device identifier live here. Empty: a
    // fresh temporary directory, removed when the Tee goes.
    std::filesystem::path state_dir;
    // What TEE_RPMB_MakeFileSystem reports.
    bool rpmb_usable = true;
    // Trace lines at or below this level go to stderr (0: none).
    int trace_level = TEE_TRACE_ERROR;
    // Prefix trace lines with the host thread number.
    bool trace_thread_ids = false;
    std::string os_manufacturer = "Host TEE Emulation";
    std::string os_version = "1.0.0";
};

// A TA living in the host process but written against host C++, such as
// the stand-ins for the provisioning and fingerprint TAs. Its calls are
// serialised like those of any TA.
class NativeTa {
  public:
    virtual ~NativeTa() = default;
    virtual TEE_UUID uuid() const = 0;
    virtual TEE_Result open_session(const TEE_Identity &client, void **ctx) = 0;
    virtual void close_session(void *ctx) = 0;
    virtual TEE_Result invoke(void *ctx, uint32_t cmd, uint32_t types, TEE_Param params[4]) = 0;
};

namespace detail {
struct Globals;
}

class Tee {
  public:
    // Tee - starts the emulated TEE. Aborts if another Tee is alive.
    explicit Tee(Config config = {});
    // ~Tee - closes every session (destroying TA instances) and wipes the
    // platform's secrets.
    ~Tee();
    Tee(const Tee &) = delete;
    Tee &operator=(const Tee &) = delete;

    // install_ta - makes a TA loadable by its UUID. The header outlives the Tee.
    void install_ta(const ta_header_t *header);
    void install_native_ta(std::shared_ptr<NativeTa> ta);

    // open_session - opens a session for `client`; creates the TA instance
    // first when none is alive. On success *session holds a nonzero id.
    TEE_Result open_session(const TEE_UUID &ta, const TEE_Identity &client, uint32_t param_types, TEE_Param params[4],
                            uint32_t *session);
    // invoke - TEE_ERROR_BAD_STATE for an unknown session.
    TEE_Result invoke(uint32_t session, uint32_t command, uint32_t param_types, TEE_Param params[4]);
    // close_session - unknown ids are ignored; the last close destroys the instance.
    void close_session(uint32_t session);

    // has_ta - whether a TA of that UUID is installed.
    bool has_ta(const TEE_UUID &ta) const;
    // instance_alive - whether the TA of that UUID currently has an instance.
    bool instance_alive(const TEE_UUID &ta) const;
    size_t open_sessions() const;

    const Config &config() const;
    // set_rpmb_usable - changes what TEE_RPMB_MakeFileSystem reports from now on.
    void set_rpmb_usable(bool usable);
    // boot_seed - the 32 bytes TEE_GetBootSeed gives during this Tee's life.
    std::vector<uint8_t> boot_seed() const;

    // current - the live Tee, or null.
    static Tee *current();

    struct Impl;
    // impl_for_detail - for the platform's own sources only.
    detail::Globals &impl_for_detail();

  private:
    std::unique_ptr<Impl> impl_;
};

// An identity for a normal-world client and for a TA client.
TEE_Identity normal_world_identity();
TEE_Identity ta_identity(const TEE_UUID &uuid);

// The TA heap: counted against the TA's data size.
namespace heap {
struct Allocation {
    size_t size;
    std::string file;
    int line;
};
struct Stats {
    size_t live_count;
    size_t live_bytes;
    size_t peak_bytes;
    uint64_t allocations; // attempts since the Tee started
    size_t limit;
};
Stats stats();
// live - the allocations not freed yet, oldest first.
std::vector<Allocation> live();
// fail_nth - the nth allocation attempt from now (1 = the next) fails;
// 0 disarms.
void fail_nth(uint64_t n);
// injected_failure_fired - whether the armed failure has happened.
bool injected_failure_fired();
// leaks_at_last_destroy - what was still live when a TA instance last ended.
std::vector<Allocation> leaks_at_last_destroy();
} // namespace heap

// The platform clocks. By default they follow the host's clocks; once
// frozen they move only when a test advances them.
namespace clock {
void freeze();
void unfreeze();
void advance_system_ms(uint64_t ms);
void advance_ree_ms(int64_t ms);
void advance_ms(uint64_t ms); // both clocks
void set_ree_ms(uint64_t ms_since_epoch);
uint64_t system_ms();
uint64_t ree_ms();
} // namespace clock

// The random source: scripted bytes are handed out first, in order.
namespace rng {
void script(const std::vector<uint8_t> &bytes);
size_t scripted_left();
} // namespace rng

// Prepared asymmetric keys: the live Tee keeps the last few RSA and EC keys
// it prepared (in its own memory, never the TA's), so that a key populated
// again with the same components skips OpenSSL's per-key set-up and, for
// EC, the checks made when the key was first populated. Each cache starts
// empty with its Tee and is wiped when the Tee ends; with no Tee alive the
// counters read zero.
struct PreparedKeyStats {
    uint64_t hits = 0;   // preparations served from the cache since the Tee started
    uint64_t misses = 0; // keys prepared anew (EC: populated or generated keys first seen)
    size_t size = 0;     // keys held now
};
namespace rsa_cache {
using Stats = PreparedKeyStats;
Stats stats();
} // namespace rsa_cache
namespace ec_cache {
using Stats = PreparedKeyStats;
Stats stats();
} // namespace ec_cache

// Power cuts, for crash-safety tests run in a child process: every file
// the platform replaces (stored objects, the factory store) goes through
// one atomic write, and the process can be made to end (_exit with
// kExitCode) at one of its steps, as if the machine lost power there.
namespace crash {
enum class Point {
    partial_write, // half of the temporary file written
    written,       // the temporary written, not synced
    synced,        // the temporary synced, not yet renamed
    renamed,       // renamed over the target, directory not synced
};
constexpr int kExitCode = 86;
// die_at - the nth atomic write from now (1: the next) to reach `point` ends the process there.
void die_at(Point point, uint64_t nth = 1);
void disarm();
} // namespace crash

// Trace lines as the TA emitted them.
namespace trace {
struct Line {
    int level;
    std::string func;
    int line;
    std::string message;   // the formatted text, without the trailing newline
    std::string formatted; // the whole line as written, newline included
};
void set_level(int level);
int level();
// capture - start (true) or stop (false) keeping lines; starting clears.
void capture(bool on);
std::vector<Line> captured();
void clear();
} // namespace trace

} // namespace tee_host

// Object and operation handles the TA holds.
namespace tee_host::handles {
// live_objects - transient and persistent object handles not freed or closed yet.
size_t live_objects();
// live_operations - operation handles not freed yet.
size_t live_operations();
// leaked_at_last_destroy - how many handles (objects and operations) were
// still live when a TA instance last ended; each was reported on stderr
// and freed then.
size_t leaked_at_last_destroy();
} // namespace tee_host::handles

// The provisioning TA: the device's factory store of SOTER material (the
// attestation key pair, the SOTER property set, the CPU identifier) and
// its device identifier, answering the Keymaster TA's requests over a
// TA-to-TA session. Every Tee installs it under kProvisioningTaUuid.
namespace tee_host {

extern const TEE_UUID kProvisioningTaUuid;

namespace provisioning {

// FactoryData - what the factory step stores. RSA components are unsigned
// big-endian; the five CRT values come all together or not at all. The
// fingerprint TA UUID is stored in the TEE's in-memory UUID layout.
struct FactoryData {
    std::vector<uint8_t> n, e, d, p, q, dp, dq, qinv;
    std::string sensor_name;
    std::string sensor_version;
    TEE_UUID fp_ta_uuid{};
    std::string cpu_id; // at most 64 bytes
};

enum class StoreResult { stored, already_provisioned, invalid, io_error };

// store - writes the factory data into state_dir, atomically (a crash
// leaves the old store or the new one). already_provisioned, with nothing
// written, when a store exists and force is false; invalid when a value
// does not fit its field (a component or text over 65535 bytes, a CPU
// identifier over 64, some but not all CRT values).
StoreResult store(const std::filesystem::path &state_dir, const FactoryData &data, bool force);
// provisioned - whether state_dir holds a factory store.
bool provisioned(const std::filesystem::path &state_dir);

// The requests the provisioning TA answers.
enum class Request { key, data, soter_properties, cpu_id, device_id };

// Answer - what a request gets instead of the store's answer: an error, or
// (with result TEE_SUCCESS) these bytes, subject to the caller's buffer.
struct Answer {
    TEE_Result result = TEE_SUCCESS;
    std::vector<uint8_t> bytes;
};

// answer_next - the next request of this kind gets `answer` (answers queue
// up); answer_always - every later one does, once the queue is empty.
void answer_next(Request request, Answer answer);
void answer_always(Request request, Answer answer);
// reset - back to answering from the store, counts cleared. A new Tee starts reset.
void reset();
// served - the requests of this kind answered since the last reset.
size_t served(Request request);

// fingerprint_ta_uuid - the fingerprint TA's UUID that the store of
// state_dir names; false when there is no readable store or it names none.
bool fingerprint_ta_uuid(const std::filesystem::path &state_dir, TEE_UUID *uuid);

// The answers built from factory data, as the store gives them.
std::vector<uint8_t> key_answer(const FactoryData &data);
std::vector<uint8_t> soter_property_answer(const FactoryData &data);

} // namespace provisioning

// The fingerprint TA: the device's fingerprint service. When a finger
// matches, it tells the Keymaster TA which fingerprint it was (command
// 0xFF04) over a TA-to-TA session opened through the GP client API, with a
// timestamp read from the TEE system time. It is registered under the UUID
// that the factory store names; an unprovisioned device has none.
namespace fingerprint {

// The command of the Keymaster TA that takes the notification.
constexpr uint32_t kNotifyCommand = 0xFF04;

// notification - the 16 bytes the TA sends: version, fid, timestamp in
// milliseconds, little-endian.
std::vector<uint8_t> notification(uint32_t version, uint32_t fid, uint64_t timestamp_ms);

// notify - the fingerprint TA sends the notification for fid (version 0,
// stamped now) to the TA `target`. TEE_ERROR_ITEM_NOT_FOUND when the device
// is not provisioned (there is no fingerprint TA); otherwise the result of
// opening the session or of the command.
TEE_Result notify(const TEE_UUID &target, uint32_t fid);

// send - the fingerprint TA sends exactly these bytes instead.
TEE_Result send(const TEE_UUID &target, const std::vector<uint8_t> &bytes);

// send_as - the bytes sent from a session whose client identity is
// `client` rather than the fingerprint TA's own: what another TA, or a
// caller with another login, would try.
TEE_Result send_as(const TEE_UUID &target, const TEE_Identity &client, const std::vector<uint8_t> &bytes);

} // namespace fingerprint

namespace detail {
// make_provisioning_ta - the provisioning TA on a state directory; the Tee installs it at start.
std::shared_ptr<NativeTa> make_provisioning_ta(const std::filesystem::path &state_dir);
} // namespace detail

} // namespace tee_host

#endif // TEE_HOST_H
