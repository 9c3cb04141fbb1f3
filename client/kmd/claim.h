/*
 * claim.h - what kmd takes before it serves: its state directory, kept
 * from other kmd processes and from embedded kmctl runs (state_dir.h), and
 * its listening socket.
 */
#ifndef KMD_CLAIM_H
#define KMD_CLAIM_H

#include <filesystem>
#include <stdexcept>
#include <string>

#include <sys/types.h>

namespace kmd {

// StartError - why kmd cannot start, as a sentence for its user.
class StartError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

// StateClaim - the state directory, created (mode 0700) when missing, held
// for this kmd: its kmd.lock taken, then its TEE lock while kmd starts, so
// that a running embedded kmctl finishes first and a later one refuses.
class StateClaim {
  public:
    // StateClaim - throws StartError when another kmd holds the directory
    // or a lock file cannot be used. Waits, saying so on stderr, while an
    // embedded kmctl runs on it.
    explicit StateClaim(const std::filesystem::path &dir);
    // ~StateClaim - releases both locks and forgets the socket.
    ~StateClaim();
    StateClaim(const StateClaim &) = delete;
    StateClaim &operator=(const StateClaim &) = delete;

    // serving - names the socket in kmd.lock and lets kmctl processes in:
    // from now on they find kmd serving. Throws StartError.
    void serving(const std::filesystem::path &socket);

  private:
    std::filesystem::path dir_;
    int kmd_fd_ = -1; // kmd.lock, held for kmd's life
    int tee_fd_ = -1; // lock, held until serving()
};

// default_socket - kmd/kmd.sock under $XDG_RUNTIME_DIR when that is set
// and absolute, else under the state directory.
std::filesystem::path default_socket(const std::filesystem::path &state_dir);

// Listener - a listening Unix stream socket at path, mode 0600. With
// private_dir, the directory holding it is created with mode 0700 and must
// be this user's and closed to others. A socket file left by a kmd that
// died is replaced; one that answers is another kmd's, and refused.
class Listener {
  public:
    Listener(const std::filesystem::path &path, bool private_dir);
    // ~Listener - closes the socket and removes its file, if it is still ours.
    ~Listener();
    Listener(const Listener &) = delete;
    Listener &operator=(const Listener &) = delete;

    int fd() const { return fd_; }
    const std::filesystem::path &path() const { return path_; }

  private:
    std::filesystem::path path_;
    int fd_ = -1;
    dev_t dev_ = 0;
    ino_t ino_ = 0;
};

} // namespace kmd

#endif
