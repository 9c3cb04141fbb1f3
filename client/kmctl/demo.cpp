/*
 * demo.cpp - `kmctl demo`: walks every capability kmctl has, each step
 * run as the user would type it (this same binary, a fresh state
 * directory and work directory), showing the command, what it printed and
 * whether its exit code is the one expected. Exits 1 when any step is not.
 */
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <memory>
#include <string>
#include <vector>

#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include "common.h"

extern char **environ;

namespace kmctl {
namespace {

namespace fs = std::filesystem;

struct Step {
    const char *title; // printed before the step, when not null
    std::vector<std::string> args;
    int expected;
};

// The walk, section by section. Files live in the work directory.
const std::vector<Step> &steps() {
    static const std::vector<Step> walk = {
        {"What the TA supports", {"info"}, kExitOk},

        {"HMAC-SHA-256: a MAC that verifies until the message changes",
         {"generate", "--algorithm", "hmac", "--size", "256", "--digest", "sha256", "--out", "hmac.blob"},
         kExitOk},
        {nullptr, {"characteristics", "--key", "hmac.blob"}, kExitOk},
        {nullptr, {"sign", "--key", "hmac.blob", "--in", "message.txt", "--out", "message.mac"}, kExitOk},
        {nullptr, {"verify", "--key", "hmac.blob", "--in", "message.txt", "--signature", "message.mac"}, kExitOk},
        {nullptr, {"verify", "--key", "hmac.blob", "--in", "tampered.txt", "--signature", "message.mac"}, kExitRefused},
        {"A key bound to an application: only that application may use it",
         {"generate", "--algorithm", "hmac", "--size", "256", "--digest", "sha256", "--app-id", "my-app", "--out",
          "bound.blob"},
         kExitOk},
        {nullptr, {"characteristics", "--key", "bound.blob", "--app-id", "someone-else"}, kExitRefused},
        {nullptr,
         {"sign", "--key", "bound.blob", "--app-id", "my-app", "--in", "message.txt", "--out", "bound.mac"},
         kExitOk},

        {"RSA-2048: PSS signatures and OAEP encryption, the public key exported",
         {"generate", "--algorithm", "rsa", "--size", "2048", "--out", "rsa.blob"},
         kExitOk},
        {nullptr, {"export", "--key", "rsa.blob", "--out", "rsa.pub.pem"}, kExitOk},
        {nullptr,
         {"sign", "--key", "rsa.blob", "--padding", "rsa_pss", "--in", "message.txt", "--out", "message.sig"},
         kExitOk},
        {nullptr,
         {"verify", "--key", "rsa.blob", "--padding", "rsa_pss", "--in", "message.txt", "--signature", "message.sig"},
         kExitOk},
        {nullptr,
         {"verify", "--key", "rsa.blob", "--padding", "rsa_pss", "--in", "tampered.txt", "--signature", "message.sig"},
         kExitRefused},
        {nullptr, {"encrypt", "--key", "rsa.blob", "--in", "message.txt", "--out", "message.enc"}, kExitOk},
        {nullptr, {"decrypt", "--key", "rsa.blob", "--in", "message.enc", "--out", "message.dec"}, kExitOk},

        {"AES-256-GCM: authenticated encryption, refused with the wrong nonce",
         {"generate", "--algorithm", "aes", "--size", "256", "--block-mode", "gcm", "--padding", "none",
          "--min-mac-length", "128", "--tag", "caller_nonce", "--out", "aes.blob"},
         kExitOk},
        {nullptr,
         {"encrypt", "--key", "aes.blob", "--nonce", "000102030405060708090a0b", "--in", "message.txt", "--out",
          "message.aes"},
         kExitOk},
        {nullptr,
         {"decrypt", "--key", "aes.blob", "--nonce", "000102030405060708090a0b", "--in", "message.aes", "--out",
          "message.plain"},
         kExitOk},
        {nullptr,
         {"decrypt", "--key", "aes.blob", "--nonce", "0f0102030405060708090a0b", "--in", "message.aes", "--out",
          "forged.plain"},
         kExitRefused},

        {"ECDSA on P-256: DER signatures, the public key exported",
         {"generate", "--algorithm", "ec", "--size", "256", "--digest", "sha256", "--out", "ec.blob"},
         kExitOk},
        {nullptr, {"export", "--key", "ec.blob", "--out", "ec.pub.pem"}, kExitOk},
        {nullptr, {"sign", "--key", "ec.blob", "--in", "message.txt", "--out", "message.ecsig"}, kExitOk},
        {nullptr, {"verify", "--key", "ec.blob", "--in", "message.txt", "--signature", "message.ecsig"}, kExitOk},
        {nullptr, {"verify", "--key", "ec.blob", "--in", "tampered.txt", "--signature", "message.ecsig"}, kExitRefused},

        {"SOTER: the factory step, then the attestation key and the device identity",
         {"soter", "attk", "verify"},
         kExitRefused},
        {nullptr, {"soter", "provision"}, kExitOk},
        {nullptr, {"soter", "attk", "verify"}, kExitOk},
        {nullptr, {"soter", "attk", "export", "--out", "attk.pub.pem"}, kExitOk},
        {nullptr, {"soter", "device-id"}, kExitOk},

        {"SOTER: an application key attested by the ATTK, an authentication key by the application key",
         {"generate", "--algorithm", "rsa", "--soter", "--soter-sign-with", "attk", "--soter-counter", "--out",
          "app.blob"},
         kExitOk},
        {nullptr, {"export", "--key", "app.blob", "--out", "app.statement"}, kExitOk},
        {nullptr,
         {"soter", "verify", "export", "--in", "app.statement", "--key", "attk.pub.pem", "--pub-key-out",
          "app.pub.pem"},
         kExitOk},
        {nullptr,
         {"generate", "--algorithm", "rsa", "--soter", "--soter-uid", "1000", "--soter-sign-with-key", "app.blob",
          "--out", "auth.blob"},
         kExitOk},
        {nullptr, {"export", "--key", "auth.blob", "--out", "auth.statement"}, kExitOk},
        {nullptr,
         {"soter", "verify", "export", "--in", "auth.statement", "--key", "app.pub.pem", "--pub-key-out",
          "auth.pub.pem"},
         kExitOk},
        {nullptr, {"soter", "verify", "export", "--in", "auth.statement", "--key", "attk.pub.pem"}, kExitRefused},
        {"SOTER: finger 7 matches, the server's challenge is signed, and the server checks every member",
         {"sign", "--key", "auth.blob", "--in", "challenge.txt", "--fid", "7", "--out", "challenge.statement"},
         kExitOk},
        {nullptr,
         {"soter", "verify", "sign", "--in", "challenge.statement", "--key", "auth.pub.pem", "--challenge-file",
          "challenge.txt", "--last-counter", "1", "--uid", "1000", "--fid", "7"},
         kExitOk},
        {nullptr,
         {"soter", "verify", "sign", "--in", "challenge.statement", "--key", "auth.pub.pem", "--challenge-file",
          "message.txt"},
         kExitRefused},

        {"Forgetting a key: the blob file goes, and nothing else was ever stored",
         {"delete", "--key", "hmac.blob"},
         kExitOk},
        {nullptr, {"characteristics", "--key", "hmac.blob"}, kExitLocal},
    };
    return walk;
}

// run - this binary with args in dir; its exit code, or -1 when it could not be started or died.
int run(const std::string &self, const fs::path &state, const fs::path &dir, const std::vector<std::string> &args) {
    std::vector<std::string> argv_text = {"kmctl", "--state", state.string()};
    argv_text.insert(argv_text.end(), args.begin(), args.end());
    std::vector<char *> argv;
    for (std::string &a : argv_text)
        argv.push_back(a.data());
    argv.push_back(nullptr);
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addchdir_np(&actions, dir.c_str());
    pid_t pid = 0;
    int err = posix_spawn(&pid, self.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (err != 0)
        return -1;
    int status = 0;
    while (waitpid(pid, &status, 0) < 0)
        if (errno != EINTR)
            return -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

std::string shown(const std::vector<std::string> &args) {
    std::string s = "$ kmctl";
    for (const std::string &a : args)
        s += " " + a;
    return s;
}

void walk(const std::string &keep) {
    std::error_code ec;
    const std::string self = fs::read_symlink("/proc/self/exe", ec).string();
    if (ec)
        throw Failure(kExitLocal, "cannot find the kmctl binary: " + ec.message());
    fs::path dir;
    if (keep.empty()) {
        std::string tmpl = (fs::temp_directory_path() / "kmctl-demo-XXXXXX").string();
        if (!::mkdtemp(tmpl.data()))
            throw Failure(kExitLocal, "cannot create a work directory: " + std::string(std::strerror(errno)));
        dir = tmpl;
    } else {
        dir = keep;
        fs::create_directories(dir, ec);
        if (ec)
            throw Failure(kExitLocal, "cannot create " + keep + ": " + ec.message());
    }
    const fs::path state = dir / "state";
    // The walk runs on a TEE of its own on a fresh directory, never on a kmd.
    ::unsetenv("KMCTL_SOCKET");
    std::ofstream(dir / "message.txt") << "A message the TA signs, MACs and encrypts.\n";
    std::ofstream(dir / "tampered.txt") << "A message the TA signs, MACs and encrypts!\n";
    std::ofstream(dir / "challenge.txt") << "server-challenge-5f3a91c2";
    std::cout << "Work directory " << dir.string() << " (state in " << state.string() << ")\n";

    int unexpected = 0;
    for (const Step &step : steps()) {
        if (step.title)
            std::cout << "\n== " << step.title << " ==\n";
        std::cout << shown(step.args) << std::endl;
        const int code = run(self, state, dir, step.args);
        const bool ok = code == step.expected;
        unexpected += ok ? 0 : 1;
        std::cout << "  -> exit " << code << (ok ? " (as expected)" : " UNEXPECTED, wanted ")
                  << (ok ? "" : std::to_string(step.expected)) << "\n";
    }
    if (keep.empty())
        fs::remove_all(dir, ec);
    std::cout << "\n" << steps().size() - unexpected << " of " << steps().size() << " steps as expected\n";
    if (unexpected)
        throw Failure(kExitRefused, "kmctl demo: " + std::to_string(unexpected) + " steps did not end as expected");
}

} // namespace

Command add_demo(CLI::App &kmctl, const GlobalOptions &) {
    auto keep = std::make_shared<std::string>();
    CLI::App *app = kmctl.add_subcommand(
        "demo", "Walk every capability on a fresh state directory, showing each command and its outcome");
    app->add_option("--dir", *keep, "Work and state in DIR, kept afterwards (default: a temporary directory)");
    return {app, [keep] { walk(*keep); }};
}

} // namespace kmctl
