/*
 * random.cpp - TEE_GenerateRandom over OpenSSL's generator, with bytes a
 * test scripted handed out first; and the boot seed.
 */
#include <cstring>
#include <deque>
#include <mutex>

#include <openssl/crypto.h>
#include <openssl/rand.h>

#include "platform_internal.h"

namespace tee_host {
namespace {
struct RngState {
    std::mutex mu;
    std::deque<uint8_t> scripted;
    uint8_t pool[512];
    size_t pool_left = 0; // unread bytes at the end of pool
};
RngState &state() {
    static RngState s;
    return s;
}
} // namespace

namespace rng {
void script(const std::vector<uint8_t> &bytes) {
    std::lock_guard<std::mutex> lock(state().mu);
    state().scripted.insert(state().scripted.end(), bytes.begin(), bytes.end());
}
size_t scripted_left() {
    std::lock_guard<std::mutex> lock(state().mu);
    return state().scripted.size();
}
} // namespace rng

namespace detail {
void rng_reset() {
    std::lock_guard<std::mutex> lock(state().mu);
    state().scripted.clear();
    // Bytes drawn for one Tee are never handed out by the next.
    OPENSSL_cleanse(state().pool, sizeof state().pool);
    state().pool_left = 0;
}

void system_random(void *buf, size_t len) {
    if (len && RAND_bytes(static_cast<unsigned char *>(buf), static_cast<int>(len)) != 1)
        panic("the random generator failed");
}
} // namespace detail
} // namespace tee_host

using namespace tee_host;

extern "C" {

void TEE_GenerateRandom(void *randomBuffer, uint32_t randomBufferLen) {
    if (!randomBuffer && randomBufferLen)
        detail::panic("TEE_GenerateRandom into a null buffer");
    auto *out = static_cast<uint8_t *>(randomBuffer);
    uint32_t done = 0;
    {
        RngState &s = state();
        std::lock_guard<std::mutex> lock(s.mu);
        while (done < randomBufferLen && !s.scripted.empty()) {
            out[done++] = s.scripted.front();
            s.scripted.pop_front();
        }
    }
    // Small requests come from a pool refilled in bulk (one RAND_bytes call
    // costs as much as a MAC); each byte handed out is wiped from the pool.
    uint32_t rest = randomBufferLen - done;
    if (rest > 64) {
        detail::system_random(out + done, rest);
        return;
    }
    RngState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (s.pool_left < rest) {
        detail::system_random(s.pool, sizeof s.pool);
        s.pool_left = sizeof s.pool;
    }
    uint8_t *from = s.pool + sizeof s.pool - s.pool_left;
    std::memcpy(out + done, from, rest);
    OPENSSL_cleanse(from, rest);
    s.pool_left -= rest;
}

TEE_Result TEE_GetBootSeed(void *buf, uint32_t len) {
    if (!buf || len != sizeof detail::globals().boot_seed)
        return TEE_ERROR_BAD_PARAMETERS;
    std::memcpy(buf, detail::globals().boot_seed, len);
    return TEE_SUCCESS;
}

TEE_Result TEE_RPMB_MakeFileSystem(uint32_t *status) {
    if (!status)
        return TEE_ERROR_BAD_PARAMETERS;
    if (!detail::globals().rpmb_usable) {
        *status = 1;
        return TEE_ERROR_STORAGE_NOT_AVAILABLE;
    }
    *status = 0;
    return TEE_SUCCESS;
}

} // extern "C"
