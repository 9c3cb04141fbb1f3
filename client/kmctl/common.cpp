/*
 * common.cpp - the parts every subcommand shares.
 */
#include "common.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <iostream>
#include <mutex>
#include <thread>
#include <map>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include "km/socket_transport.h"
#include "km/state_dir.h"
#include "tee_api_extensions.h"

namespace kmctl {
namespace {

std::filesystem::path make_state_dir(const GlobalOptions &options) {
    std::filesystem::path dir = options.state_given ? std::filesystem::path(options.state_dir) : default_state_dir();
    std::error_code ec;
    bool created = std::filesystem::create_directories(dir, ec);
    if (ec)
        throw Failure(kExitLocal, "cannot create the state directory " + dir.string() + ": " + ec.message());
    if (!std::filesystem::is_directory(dir, ec))
        throw Failure(kExitLocal, "cannot use the state directory " + dir.string() + ": it is not a directory");
    if (created) {
        // Key material lives here: keep it to its owner.
        std::filesystem::permissions(dir, std::filesystem::perms::owner_all, ec);
        std::cerr << "kmctl: created the state directory " << dir.string() << '\n';
    }
    return dir;
}

} // namespace

StateLock::StateLock(const std::filesystem::path &dir) {
    std::string file = (dir / "lock").string();
    fd_ = ::open(file.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd_ < 0)
        throw Failure(kExitLocal, "cannot lock the state directory " + dir.string() + ": " + std::strerror(errno));
    if (::flock(fd_, LOCK_EX | LOCK_NB) == 0) {
        refuse_if_kmd_serves(dir);
        return;
    }
    // Another kmctl has the TEE: wait for it, and say so if it takes a while.
    std::mutex mu;
    std::condition_variable cv;
    bool done = false;
    std::thread notice([&] {
        std::unique_lock<std::mutex> lock(mu);
        if (!cv.wait_for(lock, std::chrono::seconds(1), [&] { return done; }))
            std::cerr << "kmctl: waiting for another kmctl using the state directory " << dir.string() << '\n';
    });
    int res = 0;
    while ((res = ::flock(fd_, LOCK_EX)) != 0 && errno == EINTR) {
    }
    int err = errno;
    {
        std::lock_guard<std::mutex> lock(mu);
        done = true;
    }
    cv.notify_one();
    notice.join();
    if (res != 0) {
        ::close(fd_);
        throw Failure(kExitLocal, "cannot lock the state directory " + dir.string() + ": " + std::strerror(err));
    }
    refuse_if_kmd_serves(dir);
}

// A kmd keeps its TEE on the directory: a second TEE here would run
// beside it on the same files. Checked with the lock held, so that a kmd
// starting now waits for this run instead.
void StateLock::refuse_if_kmd_serves(const std::filesystem::path &dir) {
    std::optional<std::string> socket = km::kmd_serving(dir);
    if (!socket)
        return;
    ::close(fd_);
    if (socket->empty())
        throw Failure(kExitLocal,
                      "kmd serves the state directory " + dir.string() + ": run kmctl with --socket and kmd's socket");
    throw Failure(kExitLocal, "kmd serves the state directory " + dir.string() + " on the socket " + *socket +
                                  ": run kmctl with --socket " + *socket + " (or set KMCTL_SOCKET)");
}

StateLock::~StateLock() {
    // Closing the descriptor releases the lock.
    ::close(fd_);
}

void add_global_options(CLI::App &app, GlobalOptions &options) {
    app.add_option_function<std::string>(
           "--state",
           [&options](const std::string &dir) {
               if (dir.empty())
                   throw CLI::ValidationError("--state", "the state directory must not be empty");
               options.state_dir = dir;
               options.state_given = true;
           },
           "Directory of the TEE's persistent state (default: $KMCTL_STATE, $XDG_STATE_HOME/kmctl "
           "or ~/.local/state/kmctl)")
        ->type_name("DIR");
    static const std::map<std::string, int> kLevels = {{"none", 0},
                                                       {"error", TEE_TRACE_ERROR},
                                                       {"info", TEE_TRACE_INFO},
                                                       {"debug", TEE_TRACE_DEBUG},
                                                       {"flow", TEE_TRACE_FLOW}};
    app.add_option_function<std::string>(
           "--log-level",
           [&options](const std::string &level) {
               auto it = kLevels.find(level);
               options.trace_level = it == kLevels.end() ? TEE_TRACE_ERROR : it->second;
           },
           "Platform trace lines shown on stderr: none, error, info, debug or flow (default: error)")
        ->transform(CLI::IsMember({"none", "error", "info", "debug", "flow"}, CLI::ignore_case))
        ->type_name("LEVEL");
    const char *socket = std::getenv("KMCTL_SOCKET");
    options.socket = socket ? socket : "";
    app.add_option_function<std::string>(
           "--socket",
           [&options](const std::string &path) {
               if (path.empty())
                   throw CLI::ValidationError("--socket", "the socket path must not be empty");
               options.socket = path;
           },
           "Use the TEE of the kmd listening on this socket instead of one in this process (default: "
           "$KMCTL_SOCKET; none: embedded). --state and --log-level are then kmd's.")
        ->type_name("PATH");
}

std::filesystem::path default_state_dir() {
    std::filesystem::path dir = km::default_state_dir();
    if (dir.empty())
        throw Failure(kExitUsage, "no state directory: pass --state DIR or set KMCTL_STATE");
    return dir;
}

namespace {

// The transport of a session: kmd's socket, or a TEE here on the locked directory.
std::unique_ptr<km::Transport> make_transport(const GlobalOptions &options, std::filesystem::path *state_dir,
                                              std::unique_ptr<StateLock> *lock) {
    if (!options.socket.empty())
        return std::make_unique<km::SocketTransport>(options.socket);
    *state_dir = make_state_dir(options);
    *lock = std::make_unique<StateLock>(*state_dir);
    return std::make_unique<km::EmbeddedTee>(*state_dir, options.trace_level);
}

} // namespace

Session::Session(const GlobalOptions &options)
    : transport_(make_transport(options, &state_dir_, &lock_)), client_(*transport_) {
    km::Status opened{transport_->open(), 0};
    if (opened.tee == TEE_ERROR_COMMUNICATION && !embedded())
        throw Failure(kExitTeeFailure,
                      static_cast<km::SocketTransport &>(*transport_).error() + " (" + km::describe(opened) + ")");
    check(opened);
}

void usage_error(const std::string &message) {
    throw Failure(kExitUsage, message + "\nRun with --help for more information.");
}

void check(const km::Status &status) {
    if (status.refused())
        throw Failure(kExitRefused, km::describe(status));
    if (!status.tee_failed())
        return;
    const std::string code = " (" + km::describe(status) + ")";
    switch (status.tee) {
    case TEE_ERROR_MAC_INVALID:
    case TEE_ERROR_CORRUPT_OBJECT:
        // Only a key blob is sealed under a MAC: a user's mistake, not the TEE's.
        throw Failure(kExitRefused, "the key blob is damaged or was made with another state directory" + code);
    case TEE_ERROR_STORAGE_NOT_AVAILABLE:
    case TEE_ERROR_STORAGE_NO_SPACE:
        throw Failure(kExitTeeFailure, "the TEE cannot use its storage in the state directory" + code);
    case TEE_ERROR_OUT_OF_MEMORY:
        throw Failure(kExitTeeFailure, "the TEE ran out of memory" + code);
    default:
        throw Failure(kExitTeeFailure, "the TEE failed the command" + code);
    }
}

CLI::Option *add_in_option(CLI::App &app, std::string &path, const std::string &what, bool required) {
    path = "-";
    CLI::Option *o = app.add_option("--in", path, what + (required ? " (- for stdin)" : " (- for stdin, the default)"))
                         ->type_name("FILE");
    return required ? o->required() : o;
}

CLI::Option *add_out_option(CLI::App &app, std::string &path, const std::string &what, bool required) {
    path = "-";
    CLI::Option *o =
        app.add_option("--out", path, what + (required ? " (- for stdout)" : " (- for stdout, the default)"))
            ->type_name("FILE");
    return required ? o->required() : o;
}

void check_one_stdin(std::initializer_list<std::pair<const char *, const std::string *>> inputs) {
    std::string first;
    for (const auto &[option, path] : inputs) {
        if (*path != "-")
            continue;
        if (!first.empty())
            usage_error(first + " and " + option + " cannot both read stdin");
        first = option;
    }
}

std::vector<uint8_t> read_input(const std::string &path) {
    InputStream in(path);
    std::vector<uint8_t> data;
    uint8_t chunk[16384] = {};
    size_t n = 0;
    while ((n = in.read(chunk, sizeof chunk)) > 0)
        data.insert(data.end(), chunk, chunk + n);
    explicit_bzero(chunk, sizeof chunk);
    return data;
}

void write_output(const std::string &path, std::span<const uint8_t> data) {
    OutputStream out(path);
    out.write(data);
    out.commit();
}

void write_output(const std::string &path, std::string_view text) {
    write_output(path, std::span<const uint8_t>(reinterpret_cast<const uint8_t *>(text.data()), text.size()));
}

void wipe(std::vector<uint8_t> &bytes) {
    explicit_bzero(bytes.data(), bytes.size());
    bytes.clear();
}

std::vector<uint8_t> text_bytes(const std::string &text) {
    return std::vector<uint8_t>(text.begin(), text.end());
}

InputStream::InputStream(const std::string &path) : name_(path == "-" ? "stdin" : path) {
    if (path == "-") {
        fd_ = STDIN_FILENO;
        return;
    }
    fd_ = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd_ < 0)
        throw Failure(kExitLocal, "cannot read " + path + ": " + std::strerror(errno));
    owned_ = true;
    struct stat st {};
    if (::fstat(fd_, &st) == 0 && S_ISDIR(st.st_mode)) {
        ::close(fd_);
        owned_ = false;
        throw Failure(kExitLocal, "cannot read " + path + ": it is a directory, not a file");
    }
}

InputStream::~InputStream() {
    if (owned_)
        ::close(fd_);
}

size_t InputStream::read(uint8_t *buf, size_t n) {
    size_t got = 0;
    while (got < n && !at_end_) {
        ssize_t r = ::read(fd_, buf + got, n - got);
        if (r < 0 && errno == EINTR)
            continue;
        if (r < 0)
            throw Failure(kExitLocal, "cannot read " + name_ + ": " + std::strerror(errno));
        if (r == 0)
            at_end_ = true;
        got += static_cast<size_t>(r);
    }
    return got;
}

namespace {

// The file a path finally names, through any chain of symbolic links, so
// that a link is written through rather than replaced. Relative targets
// are read from the link's own directory.
std::filesystem::path final_target(const std::filesystem::path &path) {
    std::filesystem::path p = path;
    for (int hops = 0; hops < 40; ++hops) {
        std::error_code ec;
        if (!std::filesystem::is_symlink(std::filesystem::symlink_status(p, ec)))
            return p;
        std::filesystem::path next = std::filesystem::read_symlink(p, ec);
        if (ec)
            return p;
        p = next.is_absolute() ? next : p.parent_path() / next;
    }
    throw Failure(kExitLocal, "cannot write " + path.string() + ": " + std::strerror(ELOOP));
}

void write_all(int fd, std::span<const uint8_t> data, const std::string &name) {
    const uint8_t *p = data.data();
    size_t left = data.size();
    while (left > 0) {
        ssize_t w = ::write(fd, p, left);
        if (w < 0 && errno == EINTR)
            continue;
        if (w <= 0)
            throw Failure(kExitLocal, "cannot write " + name + ": " + std::strerror(w < 0 ? errno : EIO));
        p += w;
        left -= static_cast<size_t>(w);
    }
}

} // namespace

OutputStream::OutputStream(const std::string &path) : name_(path == "-" ? "stdout" : path) {
    if (path == "-") {
        fd_ = STDOUT_FILENO;
        return;
    }
    struct stat st {};
    if (::stat(path.c_str(), &st) == 0 && !S_ISREG(st.st_mode)) {
        if (S_ISDIR(st.st_mode))
            throw Failure(kExitLocal, "cannot write " + path + ": it is a directory, not a file");
        // A device, a FIFO, /dev/stdout: written as a stream, never replaced.
        fd_ = ::open(path.c_str(), O_WRONLY | O_CLOEXEC);
        if (fd_ < 0)
            throw Failure(kExitLocal, "cannot write " + path + ": " + std::strerror(errno));
        owned_ = true;
        return;
    }
    // A regular file (or none yet) is written beside its target and renamed
    // into place, so a failed command never leaves a truncated file where a
    // good one was.
    target_ = final_target(path).string();
    temp_ = target_ + ".tmp." + std::to_string(::getpid());
    fd_ = ::open(temp_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    if (fd_ < 0 && errno == EEXIST) {
        // A leftover of this pid from a killed run.
        ::unlink(temp_.c_str());
        fd_ = ::open(temp_.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
    }
    if (fd_ < 0)
        throw Failure(kExitLocal, "cannot write " + path + ": " + std::strerror(errno));
    owned_ = true;
    // A replaced file keeps its permissions.
    if (::stat(target_.c_str(), &st) == 0)
        ::fchmod(fd_, st.st_mode & 07777);
}

OutputStream::~OutputStream() {
    if (owned_ && fd_ >= 0)
        ::close(fd_);
    if (!temp_.empty() && !committed_)
        ::unlink(temp_.c_str());
}

void OutputStream::write(std::span<const uint8_t> data) {
    if (!data.empty())
        write_all(fd_, data, name_);
}

void OutputStream::commit() {
    if (temp_.empty()) {
        // A device's own write error (a full disk behind it) shows at fsync
        // or close; stdout and character devices cannot be synced, harmlessly.
        if (owned_) {
            int err = ::fsync(fd_) == 0 || errno == EINVAL || errno == EROFS ? 0 : errno;
            int closed = ::close(fd_);
            fd_ = -1;
            if (!err && closed != 0)
                err = errno;
            if (err)
                throw Failure(kExitLocal, "cannot write " + name_ + ": " + std::strerror(err));
        }
        committed_ = true;
        return;
    }
    int err = ::fsync(fd_) == 0 ? 0 : errno;
    if (::close(fd_) != 0 && !err)
        err = errno;
    fd_ = -1;
    if (!err && ::rename(temp_.c_str(), target_.c_str()) != 0)
        err = errno;
    if (err)
        throw Failure(kExitLocal, "cannot write " + name_ + ": " + std::strerror(err));
    committed_ = true;
}

} // namespace kmctl
