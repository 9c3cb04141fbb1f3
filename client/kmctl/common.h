/*
 * common.h - what every kmctl subcommand shares: global options, exit
 * codes, opening the TEE, turning statuses into exits, and --in/--out.
 */
#ifndef KMCTL_COMMON_H
#define KMCTL_COMMON_H

#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <functional>
#include <initializer_list>
#include <memory>
#include <span>
#include <stdexcept>
#include <string>
#include <string_view>
#include <vector>

#include <CLI/CLI.hpp>

#include "km/client.h"
#include "km/embedded_tee.h"

namespace kmctl {

enum ExitCode : int {
    kExitOk = 0,
    kExitRefused = 1,    // the TA answered with a Keymaster error
    kExitUsage = 2,      // the command line was wrong
    kExitTeeFailure = 3, // the TEE failed the command
    kExitLocal = 4,      // a local file or directory could not be used
};

// Failure - ends a subcommand: main prints the message on stderr and
// exits with the code.
class Failure : public std::runtime_error {
  public:
    Failure(int code, const std::string &message) : std::runtime_error(message), code_(code) {}
    int code() const { return code_; }

  private:
    int code_;
};

struct GlobalOptions {
    std::string state_dir;    // when state_given
    bool state_given = false; // otherwise default_state_dir()
    int trace_level = 1;      // the platform trace threshold, error (1) to flow (4)
    std::string socket;       // kmd's socket, from --socket or $KMCTL_SOCKET; empty: the embedded TEE
};

// add_global_options - --state, --socket and --log-level on the top-level app.
void add_global_options(CLI::App &app, GlobalOptions &options);

// default_state_dir - $KMCTL_STATE, else $XDG_STATE_HOME/kmctl, else
// $HOME/.local/state/kmctl. Throws Failure (usage) when none is set.
std::filesystem::path default_state_dir();

// StateLock - an exclusive lock on the state directory, held by one
// embedded TEE at a time, so that kmctl processes sharing a directory run
// one after another. Waits for the lock, saying so on stderr after one
// second. Throws Failure (local) when the lock file cannot be used, or
// when a kmd serves the directory (the message names its socket).
class StateLock {
  public:
    explicit StateLock(const std::filesystem::path &dir);
    ~StateLock();
    StateLock(const StateLock &) = delete;
    StateLock &operator=(const StateLock &) = delete;

  private:
    void refuse_if_kmd_serves(const std::filesystem::path &dir);
    int fd_ = -1;
};

// Session - a session to the Keymaster TA with a client on it. With a
// socket, through the kmd listening there (no state directory, no lock,
// no TEE here). Otherwise the embedded TEE started on the state directory,
// which is created when missing (saying so on stderr) and locked for the
// session's life. Throws Failure: local when the directory cannot be made
// or locked, TEE failure when kmd cannot be reached or the session cannot
// be opened. One Session per process.
class Session {
  public:
    explicit Session(const GlobalOptions &options);
    km::Client &client() { return client_; }
    // transport - for what the client has no call for (the fingerprint notification).
    km::Transport &transport() { return *transport_; }
    // embedded - whether the TEE runs in this process; state_dir() is its
    // directory, empty through kmd.
    bool embedded() const { return lock_ != nullptr; }
    const std::filesystem::path &state_dir() const { return state_dir_; }

  private:
    std::filesystem::path state_dir_;
    std::unique_ptr<StateLock> lock_;
    std::unique_ptr<km::Transport> transport_;
    km::Client client_;
};

// usage_error - throws Failure with the usage exit code; the message is
// followed by a pointer to --help, as CLI11's own errors are.
[[noreturn]] void usage_error(const std::string &message);

// check - returns for an ok status; throws Failure with describe(status)
// and the refusal or TEE-failure exit code otherwise.
void check(const km::Status &status);

// take - the value of an ok result; throws as check does.
template <typename T> T take(km::Result<T> result) {
    check(result.status);
    return std::move(result.value);
}

// add_in_option / add_out_option - --in FILE / --out FILE on a subcommand,
// defaulting to "-" (stdin / stdout) unless required.
CLI::Option *add_in_option(CLI::App &app, std::string &path, const std::string &what, bool required = false);
CLI::Option *add_out_option(CLI::App &app, std::string &path, const std::string &what, bool required = false);

// check_one_stdin - refuses (usage) when more than one of the named
// inputs is "-": stdin can be read only once.
void check_one_stdin(std::initializer_list<std::pair<const char *, const std::string *>> inputs);

// read_input - the whole of a file, or of stdin for "-". Throws Failure
// (local) when it cannot be read.
std::vector<uint8_t> read_input(const std::string &path);

// write_output - writes data to stdout for "-"; otherwise to a file,
// replaced only once the new content is complete. Throws Failure (local).
void write_output(const std::string &path, std::span<const uint8_t> data);
void write_output(const std::string &path, std::string_view text);

// wipe - overwrites bytes that held key material, in a way the compiler
// keeps, and empties the vector.
void wipe(std::vector<uint8_t> &bytes);

// text_bytes - the bytes of a command-line text, as given.
std::vector<uint8_t> text_bytes(const std::string &text);

// InputStream - a file, or stdin for "-", read piece by piece so that
// large inputs never sit in memory whole. Throws Failure (local) when the
// file cannot be opened or read.
class InputStream {
  public:
    explicit InputStream(const std::string &path);
    ~InputStream();
    InputStream(const InputStream &) = delete;
    InputStream &operator=(const InputStream &) = delete;

    // read - up to n bytes into buf; fewer only at the end, 0 once it is reached.
    size_t read(uint8_t *buf, size_t n);

  private:
    int fd_ = -1;
    bool owned_ = false;
    bool at_end_ = false;
    std::string name_;
};

// OutputStream - stdout for "-"; a path that exists and is not a regular
// file (a device, a FIFO, /dev/stdout) written as a stream; otherwise a
// temporary file beside the path's final target (symbolic links are
// followed) that commit renames into place. Destroyed without commit, it
// removes the temporary and leaves the target as it was. Every failure
// throws Failure (local) with the reason.
class OutputStream {
  public:
    explicit OutputStream(const std::string &path);
    ~OutputStream();
    OutputStream(const OutputStream &) = delete;
    OutputStream &operator=(const OutputStream &) = delete;

    void write(std::span<const uint8_t> data);
    void commit();

  private:
    int fd_ = -1;
    bool owned_ = false;
    std::string name_;   // as the user gave it, for messages
    std::string target_; // the regular file replaced on commit
    std::string temp_;   // empty when streaming
    bool committed_ = false;
};

// Command - a subcommand's CLI11 app and what runs when it is chosen.
struct Command {
    CLI::App *app;
    std::function<void()> run;
};

// The subcommands, one source file each.
Command add_info(CLI::App &kmctl, const GlobalOptions &options);
Command add_generate(CLI::App &kmctl, const GlobalOptions &options);
Command add_import(CLI::App &kmctl, const GlobalOptions &options);
Command add_characteristics(CLI::App &kmctl, const GlobalOptions &options);
Command add_delete(CLI::App &kmctl, const GlobalOptions &options);
Command add_export(CLI::App &kmctl, const GlobalOptions &options);
Command add_sign(CLI::App &kmctl, const GlobalOptions &options);
Command add_verify(CLI::App &kmctl, const GlobalOptions &options);
Command add_encrypt(CLI::App &kmctl, const GlobalOptions &options);
Command add_decrypt(CLI::App &kmctl, const GlobalOptions &options);
Command add_demo(CLI::App &kmctl, const GlobalOptions &options);

} // namespace kmctl

#endif
