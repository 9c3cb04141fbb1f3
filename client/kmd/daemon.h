/*
 * daemon.h - kmd's core: one emulated TEE with the Keymaster TA alive for
 * the life of the process ("one boot"), serving normal-world clients over
 * a Unix stream socket with the frames of km/kmd_protocol.h.
 *
 * One thread runs everything: connections are non-blocking and a request
 * reaches the TA only once its whole frame has arrived, so calls from all
 * connections reach the TA one at a time and a slow or stalled client
 * holds up nobody else.
 */
#ifndef KMD_DAEMON_H
#define KMD_DAEMON_H

#include <chrono>
#include <cstddef>
#include <filesystem>
#include <memory>
#include <vector>

#include <sys/types.h>

#include "claim.h"
#include "tee_api_extensions.h"

namespace kmd {

struct Options {
    std::filesystem::path state_dir;
    std::filesystem::path socket; // empty: default_socket(state_dir), in a private directory
    // TEE trace lines and kmd's own lines up to this level reach stderr
    // (0 none, then TEE_TRACE_ERROR to TEE_TRACE_FLOW).
    int log_level = TEE_TRACE_ERROR;
    std::vector<uid_t> allowed_uids; // accepted besides kmd's own uid
};

class Daemon {
  public:
    // Daemon - claims the state directory, starts the TEE, opens the
    // session that keeps the TA instance alive, and listens. Throws
    // StartError with a sentence. One Daemon per process (one TEE).
    explicit Daemon(Options options);
    // ~Daemon - aborts every live operation begun through a connection,
    // closes every session (ending the TA instance), removes the socket and
    // releases the state directory. Reports on stderr anything the TA left.
    ~Daemon();
    Daemon(const Daemon &) = delete;
    Daemon &operator=(const Daemon &) = delete;

    // run - serves until stop(); returns at once if stop() came first.
    void run();
    // stop - makes run() return. Async-signal-safe; any thread.
    void stop();

    const std::filesystem::path &socket() const;
    // connections - how many clients are connected and not yet cleaned up
    // after; any thread. 0 means every departed client's operations and
    // sessions are gone.
    size_t connections() const;
    // wait_for_connections - waits up to timeout until connections() is n;
    // whether it came to that.
    bool wait_for_connections(size_t n, std::chrono::milliseconds timeout) const;

    struct Impl;

  private:
    std::unique_ptr<Impl> impl_;
};

} // namespace kmd

#endif
