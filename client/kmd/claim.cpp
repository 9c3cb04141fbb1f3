/*
 * claim.cpp - kmd's hold on its state directory and its socket.
 */
#include "claim.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <iostream>

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include "km/state_dir.h"

namespace kmd {
namespace {

int open_lock(const std::filesystem::path &dir, const char *name) {
    const std::string file = (dir / name).string();
    int fd = ::open(file.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    if (fd < 0)
        throw StartError("cannot lock the state directory " + dir.string() + ": " + std::strerror(errno));
    return fd;
}

bool fill_address(const std::filesystem::path &path, sockaddr_un *addr) {
    const std::string p = path.string();
    if (p.empty() || p.size() >= sizeof addr->sun_path)
        return false;
    *addr = sockaddr_un{};
    addr->sun_family = AF_UNIX;
    std::memcpy(addr->sun_path, p.c_str(), p.size() + 1);
    return true;
}

// Whether something answers on the socket file at addr.
bool answers(const sockaddr_un &addr, int *err) {
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        *err = errno;
        return false;
    }
    int res = ::connect(fd, reinterpret_cast<const sockaddr *>(&addr), sizeof addr);
    *err = res == 0 ? 0 : errno;
    ::close(fd);
    return res == 0;
}

} // namespace

StateClaim::StateClaim(const std::filesystem::path &dir) : dir_(dir) {
    std::error_code ec;
    const bool created = std::filesystem::create_directories(dir, ec);
    if (ec)
        throw StartError("cannot create the state directory " + dir.string() + ": " + ec.message());
    if (!std::filesystem::is_directory(dir, ec))
        throw StartError("cannot use the state directory " + dir.string() + ": it is not a directory");
    if (created) {
        // Key material lives here: keep it to its owner.
        std::filesystem::permissions(dir, std::filesystem::perms::owner_all, ec);
        std::cerr << "kmd: created the state directory " << dir.string() << '\n';
    }
    kmd_fd_ = open_lock(dir, km::kKmdLockFile);
    if (::flock(kmd_fd_, LOCK_EX | LOCK_NB) != 0) {
        const int err = errno;
        ::close(kmd_fd_);
        kmd_fd_ = -1;
        if (err != EWOULDBLOCK)
            throw StartError("cannot lock the state directory " + dir.string() + ": " + std::strerror(err));
        const std::string socket = km::kmd_serving(dir).value_or("");
        throw StartError("another kmd serves the state directory " + dir.string() +
                         (socket.empty() ? std::string() : " on the socket " + socket));
    }
    try {
        tee_fd_ = open_lock(dir, km::kTeeLockFile);
    } catch (...) {
        ::close(kmd_fd_);
        throw;
    }
    if (::flock(tee_fd_, LOCK_EX | LOCK_NB) == 0)
        return;
    // An embedded kmctl has the directory: it finishes first. Those that
    // come after find this kmd and refuse.
    std::cerr << "kmd: waiting for the kmctl using the state directory " << dir.string() << '\n';
    int res = 0;
    while ((res = ::flock(tee_fd_, LOCK_EX)) != 0 && errno == EINTR) {
    }
    if (res != 0) {
        const int err = errno;
        ::close(tee_fd_);
        ::close(kmd_fd_);
        throw StartError("cannot lock the state directory " + dir.string() + ": " + std::strerror(err));
    }
}

StateClaim::~StateClaim() {
    if (tee_fd_ >= 0)
        ::close(tee_fd_);
    // The socket goes with this kmd; closing releases the lock.
    if (::ftruncate(kmd_fd_, 0) != 0) {
        // Nothing to do: the lock, not the name in it, says whether kmd serves.
    }
    ::close(kmd_fd_);
}

void StateClaim::serving(const std::filesystem::path &socket) {
    const std::string line = socket.string() + "\n";
    if (::ftruncate(kmd_fd_, 0) != 0 ||
        ::pwrite(kmd_fd_, line.data(), line.size(), 0) != static_cast<ssize_t>(line.size()))
        throw StartError("cannot write " + (dir_ / km::kKmdLockFile).string() + ": " + std::strerror(errno));
    ::close(tee_fd_);
    tee_fd_ = -1;
}

std::filesystem::path default_socket(const std::filesystem::path &state_dir) {
    const char *runtime = std::getenv("XDG_RUNTIME_DIR");
    std::filesystem::path base = runtime && runtime[0] == '/' ? std::filesystem::path(runtime) : state_dir;
    return base / "kmd" / "kmd.sock";
}

Listener::Listener(const std::filesystem::path &path, bool private_dir) : path_(path) {
    sockaddr_un addr{};
    if (!fill_address(path, &addr))
        throw StartError("cannot listen on " + path.string() + ": a socket path must have 1 to " +
                         std::to_string(sizeof addr.sun_path - 1) + " bytes");
    if (private_dir) {
        const std::string dir = path.parent_path().string();
        if (::mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST)
            throw StartError("cannot create the socket directory " + dir + ": " + std::strerror(errno));
        struct stat st {};
        if (::lstat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) || st.st_uid != ::geteuid() ||
            (st.st_mode & 077) != 0)
            throw StartError("the socket directory " + dir +
                             " must be a directory of this user closed to others (mode 0700)");
    }
    struct stat st {};
    if (::lstat(path_.c_str(), &st) == 0) {
        if (!S_ISSOCK(st.st_mode))
            throw StartError("cannot listen on " + path.string() + ": it exists and is not a socket");
        int err = 0;
        if (answers(addr, &err))
            throw StartError("another kmd is listening on " + path.string());
        if (err != ECONNREFUSED)
            throw StartError("cannot listen on " + path.string() + ": " + std::strerror(err));
        // Left by a kmd that died: nobody listens there any more.
        ::unlink(path_.c_str());
    }
    fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0);
    if (fd_ < 0)
        throw StartError("cannot listen on " + path.string() + ": " + std::strerror(errno));
    // The socket file is born 0600: no window in which others could connect.
    const mode_t old_mask = ::umask(0177);
    const int bound = ::bind(fd_, reinterpret_cast<const sockaddr *>(&addr), sizeof addr);
    const int bind_err = errno;
    ::umask(old_mask);
    if (bound != 0 || ::listen(fd_, 64) != 0 || ::lstat(path_.c_str(), &st) != 0) {
        const int err = bound != 0 ? bind_err : errno;
        ::close(fd_);
        if (bound == 0)
            ::unlink(path_.c_str());
        throw StartError("cannot listen on " + path.string() + ": " + std::strerror(err));
    }
    dev_ = st.st_dev;
    ino_ = st.st_ino;
}

Listener::~Listener() {
    ::close(fd_);
    // Another kmd may have replaced a file it found dead; leave its socket alone.
    struct stat st {};
    if (::lstat(path_.c_str(), &st) == 0 && st.st_dev == dev_ && st.st_ino == ino_)
        ::unlink(path_.c_str());
}

} // namespace kmd
