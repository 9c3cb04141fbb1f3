/*
 * state_dir.cpp - the state directory's default place and its kmd lock.
 */
#include "km/state_dir.h"

#include <cerrno>
#include <cstdlib>

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

namespace km {
namespace {

std::string env(const char *name) {
    const char *v = std::getenv(name);
    return v ? std::string(v) : std::string();
}

} // namespace

std::filesystem::path default_state_dir() {
    std::string explicit_dir = env("KMCTL_STATE");
    if (!explicit_dir.empty())
        return explicit_dir;
    // A relative XDG_STATE_HOME is invalid and ignored.
    std::string xdg = env("XDG_STATE_HOME");
    if (!xdg.empty() && xdg[0] == '/')
        return std::filesystem::path(xdg) / "kmctl";
    std::string home = env("HOME");
    if (!home.empty())
        return std::filesystem::path(home) / ".local" / "state" / "kmctl";
    return {};
}

std::optional<std::string> kmd_serving(const std::filesystem::path &dir) {
    const std::string file = (dir / kKmdLockFile).string();
    int fd = ::open(file.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0)
        return errno == ENOENT ? std::nullopt : std::optional<std::string>(std::string());
    // A shared lock is granted only while no kmd holds its exclusive one.
    if (::flock(fd, LOCK_SH | LOCK_NB) == 0) {
        ::close(fd);
        return std::nullopt;
    }
    std::string socket;
    char buf[256];
    ssize_t n = 0;
    while ((n = ::read(fd, buf, sizeof buf)) > 0 || (n < 0 && errno == EINTR))
        if (n > 0)
            socket.append(buf, static_cast<size_t>(n));
    ::close(fd);
    while (!socket.empty() && socket.back() == '\n')
        socket.pop_back();
    return socket;
}

} // namespace km
