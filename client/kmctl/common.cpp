/*
 * common.cpp - the parts every subcommand shares.
 */
#include "common.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <iterator>
#include <map>

#include <unistd.h>

#include "tee_api_extensions.h"

namespace kmctl {
namespace {

std::string env(const char *name) {
    const char *v = std::getenv(name);
    return v ? std::string(v) : std::string();
}

std::unique_ptr<km::EmbeddedTee> start_tee(const GlobalOptions &options) {
    std::filesystem::path dir =
        options.state_dir.empty() ? default_state_dir() : std::filesystem::path(options.state_dir);
    std::error_code ec;
    bool created = std::filesystem::create_directories(dir, ec);
    if (ec)
        throw Failure(kExitLocal, "cannot create the state directory " + dir.string() + ": " + ec.message());
    // Key material lives here: keep it to its owner.
    if (created)
        std::filesystem::permissions(dir, std::filesystem::perms::owner_all, ec);
    if (!std::filesystem::is_directory(dir, ec))
        throw Failure(kExitLocal, "the state directory " + dir.string() + " is not a directory");
    return std::make_unique<km::EmbeddedTee>(dir, options.trace_level);
}

} // namespace

void add_global_options(CLI::App &app, GlobalOptions &options) {
    app.add_option("--state", options.state_dir,
                   "Directory of the TEE's persistent state (default: $KMCTL_STATE, $XDG_STATE_HOME/kmctl "
                   "or ~/.local/state/kmctl)")
        ->type_name("DIR");
    static const std::map<std::string, int> kLevels = {
        {"error", TEE_TRACE_ERROR}, {"info", TEE_TRACE_INFO}, {"debug", TEE_TRACE_DEBUG}, {"flow", TEE_TRACE_FLOW}};
    app.add_option_function<std::string>(
           "--log-level",
           [&options](const std::string &level) {
               auto it = kLevels.find(level);
               options.trace_level = it == kLevels.end() ? TEE_TRACE_ERROR : it->second;
           },
           "Platform trace lines shown on stderr: error, info, debug or flow (default: error)")
        ->check(CLI::IsMember({"error", "info", "debug", "flow"}))
        ->type_name("LEVEL");
}

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
    throw Failure(kExitUsage, "no state directory: pass --state DIR or set KMCTL_STATE");
}

Session::Session(const GlobalOptions &options) : tee_(start_tee(options)), client_(*tee_) {
    km::Status opened{tee_->open(), 0};
    check(opened);
}

void check(const km::Status &status) {
    if (status.tee_failed())
        throw Failure(kExitTeeFailure, km::describe(status));
    if (status.refused())
        throw Failure(kExitRefused, km::describe(status));
}

CLI::Option *add_in_option(CLI::App &app, std::string &path, const std::string &what) {
    path = "-";
    return app.add_option("--in", path, what + " (- for stdin, the default)")->type_name("FILE");
}

CLI::Option *add_out_option(CLI::App &app, std::string &path, const std::string &what) {
    path = "-";
    return app.add_option("--out", path, what + " (- for stdout, the default)")->type_name("FILE");
}

std::vector<uint8_t> read_input(const std::string &path) {
    if (path == "-") {
        std::vector<uint8_t> data;
        uint8_t chunk[4096] = {};
        size_t n = 0;
        while ((n = std::fread(chunk, 1, sizeof chunk, stdin)) > 0)
            data.insert(data.end(), chunk, chunk + n);
        if (std::ferror(stdin))
            throw Failure(kExitLocal, "cannot read stdin");
        return data;
    }
    std::ifstream in(path, std::ios::binary);
    if (!in)
        throw Failure(kExitLocal, "cannot open " + path + ": " + std::strerror(errno));
    std::vector<uint8_t> data((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (in.bad())
        throw Failure(kExitLocal, "cannot read " + path);
    return data;
}

void write_output(const std::string &path, std::span<const uint8_t> data) {
    if (path == "-") {
        if (std::fwrite(data.data(), 1, data.size(), stdout) != data.size() || std::fflush(stdout) != 0)
            throw Failure(kExitLocal, "cannot write stdout");
        return;
    }
    // Write beside the target and rename, so that a failed write never
    // leaves a truncated file where a good one was.
    std::string temp = path + ".tmp." + std::to_string(::getpid());
    {
        std::ofstream out(temp, std::ios::binary | std::ios::trunc);
        out.write(reinterpret_cast<const char *>(data.data()), static_cast<std::streamsize>(data.size()));
        out.close();
        if (!out) {
            std::remove(temp.c_str());
            throw Failure(kExitLocal, "cannot write " + path);
        }
    }
    std::error_code ec;
    std::filesystem::rename(temp, path, ec);
    if (ec) {
        std::remove(temp.c_str());
        throw Failure(kExitLocal, "cannot write " + path + ": " + ec.message());
    }
}

void write_output(const std::string &path, std::string_view text) {
    write_output(path, std::span<const uint8_t>(reinterpret_cast<const uint8_t *>(text.data()), text.size()));
}

} // namespace kmctl
