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
        ->check(CLI::IsMember({"none", "error", "info", "debug", "flow"}))
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

void usage_error(const std::string &message) {
    throw Failure(kExitUsage, message + "\nRun with --help for more information.");
}

void check(const km::Status &status) {
    if (status.tee_failed())
        throw Failure(kExitTeeFailure, km::describe(status));
    if (status.refused())
        throw Failure(kExitRefused, km::describe(status));
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

void wipe(std::vector<uint8_t> &bytes) {
    explicit_bzero(bytes.data(), bytes.size());
    bytes.clear();
}

std::vector<uint8_t> text_bytes(const std::string &text) {
    return std::vector<uint8_t>(text.begin(), text.end());
}

InputStream::InputStream(const std::string &path) : name_(path == "-" ? "stdin" : path) {
    if (path == "-") {
        file_ = stdin;
        return;
    }
    file_ = std::fopen(path.c_str(), "rb");
    if (!file_)
        throw Failure(kExitLocal, "cannot open " + path + ": " + std::strerror(errno));
    owned_ = true;
}

InputStream::~InputStream() {
    if (owned_)
        std::fclose(file_);
}

size_t InputStream::read(uint8_t *buf, size_t n) {
    size_t got = 0;
    while (got < n) {
        size_t r = std::fread(buf + got, 1, n - got, file_);
        if (r == 0)
            break;
        got += r;
    }
    if (std::ferror(file_))
        throw Failure(kExitLocal, "cannot read " + name_);
    return got;
}

OutputStream::OutputStream(const std::string &path) : path_(path) {
    if (path == "-") {
        file_ = stdout;
        return;
    }
    // Written beside the target and renamed, as write_output does.
    temp_ = path + ".tmp." + std::to_string(::getpid());
    file_ = std::fopen(temp_.c_str(), "wb");
    if (!file_)
        throw Failure(kExitLocal, "cannot write " + path + ": " + std::strerror(errno));
}

OutputStream::~OutputStream() {
    if (temp_.empty() || committed_)
        return;
    std::fclose(file_);
    std::remove(temp_.c_str());
}

void OutputStream::write(std::span<const uint8_t> data) {
    if (data.empty())
        return;
    if (std::fwrite(data.data(), 1, data.size(), file_) != data.size())
        throw Failure(kExitLocal, "cannot write " + (temp_.empty() ? std::string("stdout") : path_));
}

void OutputStream::commit() {
    if (temp_.empty()) {
        if (std::fflush(stdout) != 0)
            throw Failure(kExitLocal, "cannot write stdout");
        committed_ = true;
        return;
    }
    int closed = std::fclose(file_);
    committed_ = true;
    std::error_code ec;
    if (closed == 0)
        std::filesystem::rename(temp_, path_, ec);
    if (closed != 0 || ec) {
        std::remove(temp_.c_str());
        throw Failure(kExitLocal, "cannot write " + path_ + (ec ? ": " + ec.message() : std::string()));
    }
}

} // namespace kmctl
