/*
 * atomic_file.cpp - the one way the platform replaces a file: a temporary
 * written and synced, renamed (or linked) over the target, the directory
 * synced. A crash at any step leaves the old file or the new one. Tests of
 * that claim end the process at each step (tee_host::crash).
 */
#include <atomic>
#include <cerrno>
#include <fcntl.h>
#include <unistd.h>

#include "platform_internal.h"

namespace tee_host {
namespace {

struct Armed {
    std::atomic<int> point{-1};
    std::atomic<uint64_t> left{0};
};

Armed &armed() {
    static Armed a;
    return a;
}

// Whether this step of this write is where the armed power cut happens.
bool cut_here(crash::Point p) {
    Armed &a = armed();
    if (a.point.load() != static_cast<int>(p))
        return false;
    return a.left.fetch_sub(1) == 1;
}

[[noreturn]] void power_cut() {
    ::_exit(crash::kExitCode);
}

int write_all(int fd, const uint8_t *p, size_t n) {
    while (n) {
        ssize_t w = ::write(fd, p, n);
        if (w < 0 && errno == EINTR)
            continue;
        if (w <= 0)
            return w < 0 ? errno : EIO;
        p += w;
        n -= static_cast<size_t>(w);
    }
    return 0;
}

} // namespace

namespace crash {
void die_at(Point point, uint64_t nth) {
    armed().left.store(nth);
    armed().point.store(static_cast<int>(point));
}
void disarm() {
    armed().point.store(-1);
}
} // namespace crash

namespace detail {

int sync_dir(const std::filesystem::path &dir) {
    int fd = ::open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0)
        return errno;
    int err = ::fsync(fd) == 0 ? 0 : errno;
    ::close(fd);
    return err;
}

int atomic_write(const std::filesystem::path &file, const std::filesystem::path &tmp, const uint8_t *data, size_t n,
                 bool exclusive) {
    int fd = ::open(tmp.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    if (fd < 0)
        return errno;
    int err = 0;
    if (cut_here(crash::Point::partial_write)) {
        write_all(fd, data, n / 2);
        power_cut();
    }
    err = write_all(fd, data, n);
    if (!err && cut_here(crash::Point::written))
        power_cut();
    if (!err && ::fsync(fd) != 0)
        err = errno;
    if (::close(fd) != 0 && !err)
        err = errno;
    if (!err && cut_here(crash::Point::synced))
        power_cut();
    if (!err && exclusive) {
        // link() never replaces: of several creators exactly one wins.
        err = ::link(tmp.c_str(), file.c_str()) == 0 ? 0 : errno;
        ::unlink(tmp.c_str());
        if (err)
            return err;
    } else if (!err && ::rename(tmp.c_str(), file.c_str()) != 0) {
        err = errno;
    }
    if (err) {
        ::unlink(tmp.c_str());
        return err;
    }
    if (cut_here(crash::Point::renamed))
        power_cut();
    return sync_dir(file.parent_path());
}

} // namespace detail
} // namespace tee_host
