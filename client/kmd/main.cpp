/*
 * main.cpp - kmd: the command line, going to the background once the
 * socket is ready (unless --foreground), and the signals that stop it.
 */
#include <csignal>
#include <cstdio>
#include <iostream>
#include <map>
#include <string>

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <CLI/CLI.hpp>

#include "daemon.h"
#include "km/state_dir.h"

namespace {

enum ExitCode : int { kExitOk = 0, kExitFailed = 1, kExitUsage = 2 };

kmd::Daemon *g_daemon = nullptr;

extern "C" void on_stop_signal(int) {
    if (g_daemon)
        g_daemon->stop();
}

void install_signals() {
    struct sigaction sa {};
    sa.sa_handler = on_stop_signal;
    sigemptyset(&sa.sa_mask);
    sa.sa_flags = SA_RESTART;
    sigaction(SIGTERM, &sa, nullptr);
    sigaction(SIGINT, &sa, nullptr);
}

// Goes to the background: the parent waits until the child says it serves
// (one byte on the pipe) and exits 0, or exits with the child's failure.
// Returns in the child, with the pipe's write end in *ready.
void background(int *ready) {
    int fds[2] = {-1, -1};
    if (::pipe2(fds, O_CLOEXEC) != 0) {
        std::perror("kmd: cannot go to the background");
        std::exit(kExitFailed);
    }
    pid_t pid = ::fork();
    if (pid < 0) {
        std::perror("kmd: cannot go to the background");
        std::exit(kExitFailed);
    }
    if (pid > 0) {
        ::close(fds[1]);
        char byte = 0;
        ssize_t n = 0;
        while ((n = ::read(fds[0], &byte, 1)) < 0 && errno == EINTR) {
        }
        if (n == 1)
            std::_Exit(kExitOk);
        int status = 0;
        while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
        }
        std::_Exit(WIFEXITED(status) ? WEXITSTATUS(status) : kExitFailed);
    }
    ::close(fds[0]);
    ::setsid();
    *ready = fds[1];
}

// Detaches from the terminal's input and output; stderr stays for the log.
void detach(int ready) {
    int null = ::open("/dev/null", O_RDWR | O_CLOEXEC);
    if (null >= 0) {
        ::dup2(null, STDIN_FILENO);
        ::dup2(null, STDOUT_FILENO);
        ::close(null);
    }
    const char byte = 1;
    [[maybe_unused]] ssize_t w = ::write(ready, &byte, 1);
    ::close(ready);
}

} // namespace

int main(int argc, char **argv) {
    CLI::App app("Keep one Keymaster TEE alive for many kmctl and client-library processes, serving them on a "
                 "Unix socket.",
                 "kmd");
    std::string state_dir;
    std::string socket;
    std::string level = "error";
    bool foreground = false;
    std::vector<uid_t> allowed;
    app.add_option("--state", state_dir,
                   "Directory of the TEE's persistent state (default: $KMCTL_STATE, $XDG_STATE_HOME/kmctl or "
                   "~/.local/state/kmctl)")
        ->type_name("DIR")
        ->check([](const std::string &s) { return s.empty() ? std::string("must not be empty") : std::string(); });
    app.add_option("--socket", socket,
                   "Listen here (default: kmd/kmd.sock in $XDG_RUNTIME_DIR, else in the state directory)")
        ->type_name("PATH")
        ->check([](const std::string &s) { return s.empty() ? std::string("must not be empty") : std::string(); });
    app.add_option("--log-level", level,
                   "TEE trace lines and kmd's own shown on stderr: none, error, info, debug or flow (default: error)")
        ->transform(CLI::IsMember({"none", "error", "info", "debug", "flow"}, CLI::ignore_case))
        ->type_name("LEVEL");
    app.add_flag("--foreground", foreground, "Stay in the foreground (as under systemd) instead of detaching");
    app.add_option("--allow-uid", allowed, "Also accept clients of this user id (repeatable)")->type_name("UID");
    app.set_version_flag("--version", "kmd " KM_VERSION, "Print kmd's version and exit");
    try {
        app.parse(argc, argv);
    } catch (const CLI::ParseError &e) {
        return app.exit(e) == 0 ? kExitOk : kExitUsage;
    }

    static const std::map<std::string, int> kLevels = {{"none", 0},
                                                       {"error", TEE_TRACE_ERROR},
                                                       {"info", TEE_TRACE_INFO},
                                                       {"debug", TEE_TRACE_DEBUG},
                                                       {"flow", TEE_TRACE_FLOW}};
    kmd::Options options;
    options.log_level = kLevels.at(level);
    options.allowed_uids = allowed;
    std::error_code ec;
    options.state_dir = state_dir.empty() ? km::default_state_dir() : std::filesystem::path(state_dir);
    if (options.state_dir.empty()) {
        std::cerr << "kmd: no state directory: pass --state DIR or set KMCTL_STATE\n";
        return kExitUsage;
    }
    // Absolute, so that nothing depends on the directory kmd was started in.
    options.state_dir = std::filesystem::absolute(options.state_dir, ec);
    if (!socket.empty())
        options.socket = std::filesystem::absolute(socket, ec);

    // A client that goes away mid-reply must not kill kmd.
    std::signal(SIGPIPE, SIG_IGN);
    int ready = -1;
    if (!foreground)
        background(&ready);
    try {
        kmd::Daemon daemon(options);
        g_daemon = &daemon;
        install_signals();
        if (ready >= 0)
            detach(ready);
        daemon.run();
        // Cleaning up is not cut short by a second signal.
        std::signal(SIGTERM, SIG_IGN);
        std::signal(SIGINT, SIG_IGN);
        g_daemon = nullptr;
    } catch (const std::exception &e) {
        std::cerr << "kmd: " << e.what() << '\n';
        return kExitFailed;
    }
    return kExitOk;
}
