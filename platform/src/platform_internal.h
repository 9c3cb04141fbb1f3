/*
 * platform_internal.h - state shared between the platform's source files.
 */
#ifndef PLATFORM_INTERNAL_H
#define PLATFORM_INTERNAL_H

#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "tee_host.h"

namespace tee_host::detail {

// The identity of the client whose call the current thread is serving,
// or null outside entry-point calls.
const TEE_Identity *current_client();

// The TA whose entry point the current thread is running, or null.
const ta_header_t *current_ta();

// Heap bookkeeping at instance boundaries.
void heap_reset(size_t limit);
// heap_instance_ended - records and reclaims what the instance of `owner` still holds.
void heap_instance_ended(const void *owner);
// handles_instance_ended - at instance end, reports each object and
// operation handle still live on stderr, records the count and frees them.
void handles_instance_ended(const void *owner);

// Clocks and random source back to their defaults.
void clock_reset();
void rng_reset();
void trace_reset(int level, bool thread_ids);

// The crypto families' fetched algorithms and caches (crypto_state.h).
struct CryptoState;
struct CryptoStateDelete {
    void operator()(CryptoState *s) const;
};
using CryptoStatePtr = std::unique_ptr<CryptoState, CryptoStateDelete>;
// start_crypto - a fresh crypto state, made as a Tee starts.
CryptoStatePtr start_crypto();

// Facts of the live Tee; panics when none is alive.
struct Globals {
    Config config;
    TEE_UUID device_id;
    uint8_t boot_seed[32];
    bool rpmb_usable;
    // Created as the Tee starts, freed (wiping its secrets) as it ends.
    CryptoStatePtr crypto;
};
Globals &globals();

// atomic_write - data becomes `file` (mode 0600) through the temporary
// `tmp`: written, synced, renamed over it (exclusive: linked, so EEXIST
// when a file is there, nothing replaced), the directory synced. 0 or an
// errno; a failure leaves the old file and no temporary.
int atomic_write(const std::filesystem::path &file, const std::filesystem::path &tmp, const uint8_t *data, size_t n,
                 bool exclusive);
// sync_dir - fsync of a directory; 0 or an errno.
int sync_dir(const std::filesystem::path &dir);

// Formats and parses the canonical 8-4-4-4-12 text form of a UUID.
std::string uuid_to_string(const TEE_UUID &u);
bool uuid_from_string(const std::string &s, TEE_UUID *out);

// Platform panic for API misuse: prints and aborts.
[[noreturn]] void panic(const char *what);

// Fills buf from OpenSSL's generator (scripted bytes are not used).
void system_random(void *buf, size_t len);

} // namespace tee_host::detail

#endif
