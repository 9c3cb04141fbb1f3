/*
 * kmd through the client library. A real kmd process on a socket in a
 * temporary directory shows what one boot means across client connections,
 * cleans up after clients that die, and survives hostile frames; kmd's
 * core run inside this process lets the concurrency test read the TA heap;
 * embedded kmctl runs on one state directory take turns and make one
 * key-store key.
 */
#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <fstream>
#include <functional>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <openssl/bio.h>
#include <openssl/evp.h>
#include <openssl/pem.h>

#include <gtest/gtest.h>

#include "daemon.h"
#include "keymaster_defs.h"
#include "km/client.h"
#include "km/key_material.h"
#include "km/kmd_protocol.h"
#include "km/socket_transport.h"
#include "rsa_keys.h"
#include "scratch_dir.h"
#include "soter_keys.h"
#include "ta_entry.h"
#include "tee_host.h"

extern char **environ;

namespace {

namespace fs = std::filesystem;
namespace proto = km::kmd;
using km::Bytes;
using km::ParamSet;
using namespace std::chrono_literals;

constexpr auto kDeadline = 60s; // generous: the ASan build on a loaded machine

std::string read_file(const fs::path &p) {
    std::ifstream in(p, std::ios::binary);
    std::stringstream s;
    s << in.rdbuf();
    return s.str();
}

// ---- child processes ----

// spawn - runs argv with the environment changed by `set` ("NAME=value")
// and `unset` (names); stderr to err_file when given, else to a pipe whose
// read end goes to *err_pipe.
pid_t spawn(const std::vector<std::string> &argv, const fs::path &err_file, int *err_pipe = nullptr,
            const std::vector<std::string> &set = {}, const std::vector<std::string> &unset = {}) {
    std::vector<std::string> env;
    for (char **e = environ; *e; ++e) {
        std::string entry = *e;
        std::string name = entry.substr(0, entry.find('='));
        bool drop = std::find(unset.begin(), unset.end(), name) != unset.end();
        for (const std::string &s : set)
            drop = drop || s.substr(0, s.find('=')) == name;
        if (!drop)
            env.push_back(entry);
    }
    env.insert(env.end(), set.begin(), set.end());
    std::vector<char *> envp, args;
    for (std::string &e : env)
        envp.push_back(e.data());
    envp.push_back(nullptr);
    std::vector<std::string> argv_copy = argv;
    for (std::string &a : argv_copy)
        args.push_back(a.data());
    args.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    int fds[2] = {-1, -1};
    if (err_file.empty()) {
        if (pipe2(fds, O_CLOEXEC) != 0)
            return -1;
        posix_spawn_file_actions_adddup2(&actions, fds[1], STDERR_FILENO);
    } else {
        posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, err_file.c_str(), O_WRONLY | O_CREAT | O_APPEND,
                                         0600);
    }
    pid_t pid = -1;
    int res = posix_spawn(&pid, args[0], &actions, nullptr, args.data(), envp.data());
    posix_spawn_file_actions_destroy(&actions);
    if (fds[1] >= 0)
        close(fds[1]);
    if (err_pipe)
        *err_pipe = fds[0];
    return res == 0 ? pid : -1;
}

// exit_code - waits for pid: its exit code, or 128 + the signal that ended it.
int exit_code(pid_t pid) {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// read_until - reads fd into *text until it holds needle; false at the
// deadline or at the end of the stream.
bool read_until(int fd, std::string *text, const std::string &needle) {
    const auto end = std::chrono::steady_clock::now() + kDeadline;
    while (text->find(needle) == std::string::npos) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(end - std::chrono::steady_clock::now());
        pollfd p{fd, POLLIN, 0};
        if (left.count() <= 0 || poll(&p, 1, static_cast<int>(left.count())) <= 0)
            return false;
        char buf[4096];
        ssize_t n = read(fd, buf, sizeof buf);
        if (n <= 0)
            return false;
        text->append(buf, static_cast<size_t>(n));
    }
    return true;
}

bool connectable(const fs::path &socket) {
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    std::strncpy(addr.sun_path, socket.c_str(), sizeof addr.sun_path - 1);
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    bool ok = fd >= 0 && connect(fd, reinterpret_cast<const sockaddr *>(&addr), sizeof addr) == 0;
    if (fd >= 0)
        close(fd);
    return ok;
}

// A kmd process in the foreground, its stderr (at info level) in a log
// file beside the state directory.
class KmdProcess {
  public:
    // KmdProcess - starts kmd and waits until its socket answers; socket
    // is where kmd will listen (passed with --socket unless default_socket).
    KmdProcess(const fs::path &state, const fs::path &socket, std::vector<std::string> extra = {},
               std::vector<std::string> env = {}, bool default_socket = false)
        : socket_(socket), log_(state.string() + ".kmd" + std::to_string(++starts_) + ".log") {
        std::vector<std::string> argv = {KMD_PATH, "--foreground", "--state", state.string(), "--log-level", "info"};
        if (!default_socket) {
            argv.push_back("--socket");
            argv.push_back(socket.string());
        }
        argv.insert(argv.end(), extra.begin(), extra.end());
        pid_ = spawn(argv, log_, nullptr, env);
        if (pid_ < 0)
            return;
        // Polled: kmd says nothing on a channel this test could wait on.
        const auto end = std::chrono::steady_clock::now() + kDeadline;
        while (std::chrono::steady_clock::now() < end) {
            int status = 0;
            if (waitpid(pid_, &status, WNOHANG) == pid_) {
                exit_ = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
                pid_ = -1;
                return;
            }
            if (connectable(socket_)) {
                up_ = true;
                return;
            }
            std::this_thread::sleep_for(5ms);
        }
    }
    ~KmdProcess() {
        if (pid_ > 0) {
            kill(pid_, SIGKILL);
            exit_code(pid_);
        }
    }
    KmdProcess(const KmdProcess &) = delete;
    KmdProcess &operator=(const KmdProcess &) = delete;

    bool up() const { return up_; }
    // exited - the exit code of a kmd that ended by itself at start, else -1.
    int exited() const { return exit_; }
    pid_t pid() const { return pid_; }
    // stop - sends sig and returns the exit code.
    int stop(int sig = SIGTERM) {
        kill(pid_, sig);
        int code = exit_code(pid_);
        pid_ = -1;
        return code;
    }
    std::string log() const { return read_file(log_); }

  private:
    static inline int starts_ = 0;
    fs::path socket_;
    fs::path log_;
    pid_t pid_ = -1;
    int exit_ = -1;
    bool up_ = false;
};

// ---- keys and operations through the client library ----

// A session to kmd with a client on it.
struct Connection {
    explicit Connection(const fs::path &socket) : transport(socket), client(transport) { opened = transport.open(); }
    km::SocketTransport transport;
    km::Client client;
    TEE_Result opened;
};

const Bytes kHmacKey(32, 0x5A);

ParamSet hmac_key_params() {
    ParamSet p;
    p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
        .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
        .add(KM_TAG_MIN_MAC_LENGTH, 256)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
        .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
        .add_bool(KM_TAG_NO_AUTH_REQUIRED);
    return p;
}

ParamSet mac_params() {
    ParamSet p;
    p.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_MAC_LENGTH, 256);
    return p;
}

ParamSet rsa_params() {
    ParamSet p;
    p.add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256).add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN);
    return p;
}

Bytes import_hmac(km::Client &c, ParamSet extra = {}) {
    ParamSet p = hmac_key_params();
    for (const km::Param &x : extra.params())
        p.add(x.tag, x.value);
    km::Result<km::ImportedKey> r = c.import_key(p, kHmacKey);
    EXPECT_TRUE(r.ok()) << km::describe(r.status);
    return r.value.blob;
}

Bytes expected_mac(const Bytes &msg) {
    Bytes out(32);
    size_t len = 0;
    EVP_Q_mac(nullptr, "HMAC", nullptr, "SHA256", nullptr, kHmacKey.data(), kHmacKey.size(), msg.data(), msg.size(),
              out.data(), out.size(), &len);
    out.resize(len);
    return out;
}

// run - begin, update until the input is taken, finish: the output, or the
// first failing status. The operation is ended whatever happens.
km::Result<Bytes> run(km::Client &c, uint32_t purpose, const Bytes &blob, const ParamSet &params, const Bytes &msg,
                      const Bytes &signature = {}) {
    km::Result<Bytes> r;
    km::Result<km::Operation> op = c.begin(purpose, blob, params);
    if (!op.ok()) {
        r.status = op.status;
        return r;
    }
    size_t taken = 0;
    while (taken < msg.size()) {
        km::Result<km::UpdateOutput> u = c.update(op.value.handle, std::span(msg).subspan(taken));
        if (!u.ok() || u.value.consumed == 0) {
            r.status = u.ok() ? km::Status{TEE_ERROR_BAD_FORMAT, 0} : u.status;
            c.abort(op.value.handle);
            return r;
        }
        taken += u.value.consumed;
    }
    km::Result<km::FinishOutput> f = c.finish(op.value.handle, signature);
    r.status = f.status;
    r.value = std::move(f.value.output);
    return r;
}

Bytes text(const std::string &s) {
    return Bytes(s.begin(), s.end());
}

// ---- raw frames ----

// A connection that speaks frames by hand.
class RawClient {
  public:
    explicit RawClient(const fs::path &socket) {
        sockaddr_un addr{};
        addr.sun_family = AF_UNIX;
        std::strncpy(addr.sun_path, socket.c_str(), sizeof addr.sun_path - 1);
        fd_ = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (connect(fd_, reinterpret_cast<const sockaddr *>(&addr), sizeof addr) != 0) {
            close(fd_);
            fd_ = -1;
        }
    }
    ~RawClient() { shut(); }
    RawClient(const RawClient &) = delete;
    RawClient &operator=(const RawClient &) = delete;

    bool connected() const { return fd_ >= 0; }
    void send_bytes(const Bytes &b) { ASSERT_EQ(::send(fd_, b.data(), b.size(), MSG_NOSIGNAL), ssize_t(b.size())); }
    void shut() {
        if (fd_ >= 0)
            close(fd_);
        fd_ = -1;
    }

    // reply - the next frame's body, nullopt when kmd closed the connection.
    // A reply that does not come by the deadline fails the test.
    std::optional<Bytes> reply() {
        Bytes head(4);
        if (!read_exact(head.data(), 4))
            return std::nullopt;
        Bytes body(proto::frame_length(head.data()));
        if (!read_exact(body.data(), body.size())) {
            ADD_FAILURE() << "a reply cut short";
            return std::nullopt;
        }
        return body;
    }
    // error_reply - the result of a kError reply; 0 for anything else.
    TEE_Result error_reply() {
        std::optional<Bytes> b = reply();
        if (!b || b->size() != 9 || (*b)[0] != proto::kError)
            return 0;
        return proto::frame_length(b->data() + 1);
    }

  private:
    bool read_exact(uint8_t *p, size_t n) {
        while (n > 0) {
            pollfd pfd{fd_, POLLIN, 0};
            if (poll(&pfd, 1, static_cast<int>(std::chrono::milliseconds(kDeadline).count())) != 1) {
                ADD_FAILURE() << "no reply and no close by the deadline";
                return false;
            }
            ssize_t r = recv(fd_, p, n, 0);
            if (r <= 0)
                return false;
            p += r;
            n -= static_cast<size_t>(r);
        }
        return true;
    }
    int fd_ = -1;
};

Bytes open_frame(uint32_t version = proto::kProtocolVersion) {
    return proto::FrameWriter(proto::kOpenSession).u32(version).done();
}

// ---- one boot across connections ----

class KmdTest : public ::testing::Test {
  protected:
    // stopped - stops kmd with sig, expects a clean end (exit 0, nothing
    // left by the TA), and returns kmd's log.
    static std::string stopped(KmdProcess &kmd, int sig = SIGTERM) {
        EXPECT_EQ(kmd.stop(sig), 0);
        const std::string log = kmd.log();
        EXPECT_EQ(log.find("the TA left"), std::string::npos) << log;
        return log;
    }
    // in_process - kmd's core in this process on the test's directory, silent.
    std::unique_ptr<kmd::Daemon> in_process() const {
        kmd::Options options;
        options.state_dir = state();
        options.socket = socket();
        options.log_level = 0;
        return std::make_unique<kmd::Daemon>(options);
    }
    // expect_ended - after an in-process kmd: the TA instance gone with
    // nothing left behind, and the socket removed.
    void expect_ended() const {
        EXPECT_EQ(tee_host::heap::stats().live_count, 0u);
        EXPECT_TRUE(tee_host::heap::leaks_at_last_destroy().empty());
        EXPECT_EQ(tee_host::handles::leaked_at_last_destroy(), 0u);
        EXPECT_FALSE(fs::exists(socket()));
    }
    fs::path state() const { return dir_.path() / "state"; }
    fs::path socket() const { return dir_.path() / "kmd.sock"; }
    ScratchDir dir_{"kmd-test"};
};

TEST_F(KmdTest, UsesPerBootAndRateLimitsHoldAcrossConnectionsUntilRestart) {
    Bytes twice, hourly;
    {
        KmdProcess kmd(state(), socket());
        ASSERT_TRUE(kmd.up()) << kmd.log();
        Connection a(socket()), b(socket()), c(socket());
        ASSERT_EQ(a.opened, TEE_SUCCESS);
        ASSERT_EQ(b.opened, TEE_SUCCESS);
        ASSERT_EQ(c.opened, TEE_SUCCESS);
        twice = import_hmac(a.client, ParamSet().add(KM_TAG_MAX_USES_PER_BOOT, 2));
        hourly = import_hmac(a.client, ParamSet().add(KM_TAG_MIN_SECONDS_BETWEEN_OPS, 3600));
        const Bytes msg = text("one boot");

        EXPECT_EQ(run(a.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).value, expected_mac(msg));
        EXPECT_TRUE(run(b.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).ok());
        EXPECT_EQ(run(c.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).status.km, KM_ERROR_KEY_MAX_OPS_EXCEEDED);
        // A connection closed and a new one is still the same boot.
        a.transport.close();
        Connection d(socket());
        EXPECT_EQ(run(d.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).status.km, KM_ERROR_KEY_MAX_OPS_EXCEEDED);

        EXPECT_TRUE(run(b.client, KM_PURPOSE_SIGN, hourly, mac_params(), msg).ok());
        EXPECT_EQ(run(c.client, KM_PURPOSE_SIGN, hourly, mac_params(), msg).status.km,
                  KM_ERROR_KEY_RATE_LIMIT_EXCEEDED);
        stopped(kmd);
    }
    // A new kmd is a new boot; the blobs still open on the same state.
    KmdProcess kmd(state(), socket());
    ASSERT_TRUE(kmd.up()) << kmd.log();
    Connection e(socket());
    const Bytes msg = text("next boot");
    EXPECT_EQ(run(e.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).value, expected_mac(msg));
    EXPECT_TRUE(run(e.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).ok());
    EXPECT_EQ(run(e.client, KM_PURPOSE_SIGN, twice, mac_params(), msg).status.km, KM_ERROR_KEY_MAX_OPS_EXCEEDED);
    EXPECT_TRUE(run(e.client, KM_PURPOSE_SIGN, hourly, mac_params(), msg).ok());
    stopped(kmd);
}

TEST_F(KmdTest, AHandleWorksFromAnyConnectionAndDiesWithTheOneThatBeganIt) {
    KmdProcess kmd(state(), socket());
    ASSERT_TRUE(kmd.up()) << kmd.log();
    Connection a(socket()), b(socket());
    const Bytes blob = import_hmac(a.client);
    const Bytes msg = text("begun on a, finished on b");

    km::Result<km::Operation> op = a.client.begin(KM_PURPOSE_SIGN, blob, mac_params());
    ASSERT_TRUE(op.ok()) << km::describe(op.status);
    km::Result<km::UpdateOutput> up = b.client.update(op.value.handle, msg);
    ASSERT_TRUE(up.ok()) << km::describe(up.status);
    EXPECT_EQ(up.value.consumed, msg.size());
    km::Result<km::FinishOutput> done = b.client.finish(op.value.handle);
    ASSERT_TRUE(done.ok()) << km::describe(done.status);
    EXPECT_EQ(done.value.output, expected_mac(msg));

    // Finished elsewhere, the handle is gone for its beginner too.
    EXPECT_EQ(a.client.abort(op.value.handle).km, KM_ERROR_INVALID_OPERATION_HANDLE);

    // Still running when a's connection closes: aborted with it.
    km::Result<km::Operation> left = a.client.begin(KM_PURPOSE_SIGN, blob, mac_params());
    ASSERT_TRUE(left.ok());
    a.transport.close();
    EXPECT_EQ(b.client.update(left.value.handle, msg).status.km, KM_ERROR_INVALID_OPERATION_HANDLE);
    EXPECT_NE(stopped(kmd).find("; aborted 1 operation it left running"), std::string::npos);
}

TEST_F(KmdTest, AKilledClientFreesItsOperationSlots) {
    KmdProcess kmd(state(), socket());
    ASSERT_TRUE(kmd.up()) << kmd.log();
    Connection main(socket());
    const Bytes blob = import_hmac(main.client);

    int ready[2], hold[2];
    ASSERT_EQ(pipe(ready), 0);
    ASSERT_EQ(pipe(hold), 0);
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        // Takes every slot, reports how many, and waits to be killed.
        close(ready[0]);
        close(hold[1]);
        Connection orphaner(socket());
        uint8_t begun = 0;
        for (int i = 0; i < 16; ++i)
            begun += orphaner.client.begin(KM_PURPOSE_SIGN, blob, mac_params()).ok() ? 1 : 0;
        [[maybe_unused]] ssize_t w = write(ready[1], &begun, 1);
        char c;
        [[maybe_unused]] ssize_t r = read(hold[0], &c, 1);
        _exit(0);
    }
    close(ready[1]);
    close(hold[0]);
    uint8_t begun = 0;
    ASSERT_EQ(read(ready[0], &begun, 1), 1);
    EXPECT_EQ(begun, 16);
    EXPECT_EQ(main.client.begin(KM_PURPOSE_SIGN, blob, mac_params()).status.km, KM_ERROR_TOO_MANY_OPERATIONS);
    kill(child, SIGKILL);
    EXPECT_EQ(exit_code(child), 128 + SIGKILL);
    close(ready[0]);
    close(hold[1]);

    // Sixteen at once, then a seventeenth: every slot came back.
    std::vector<uint32_t> handles;
    for (int i = 0; i < 16; ++i) {
        km::Result<km::Operation> op = main.client.begin(KM_PURPOSE_SIGN, blob, mac_params());
        ASSERT_TRUE(op.ok()) << i << ": " << km::describe(op.status);
        handles.push_back(op.value.handle);
    }
    for (uint32_t h : handles) {
        const Bytes msg = text("slot " + std::to_string(h));
        ASSERT_TRUE(main.client.update(h, msg).ok());
        EXPECT_EQ(main.client.finish(h).value.output, expected_mac(msg));
    }
    const Bytes msg = text("seventeenth");
    EXPECT_EQ(run(main.client, KM_PURPOSE_SIGN, blob, mac_params(), msg).value, expected_mac(msg));
    EXPECT_NE(stopped(kmd).find("; aborted 16 operations it left running"), std::string::npos);
}

// ---- hostile input ----

TEST_F(KmdTest, MalformedFramesAreAnsweredOrClosedWhileOthersAreServed) {
    KmdProcess kmd(state(), socket());
    ASSERT_TRUE(kmd.up()) << kmd.log();
    Connection good(socket());
    ASSERT_EQ(good.opened, TEE_SUCCESS);
    const Bytes blob = import_hmac(good.client);
    int served = 0;
    auto still_served = [&] {
        const Bytes msg = text("still served " + std::to_string(++served));
        km::Result<Bytes> mac = run(good.client, KM_PURPOSE_SIGN, blob, mac_params(), msg);
        EXPECT_TRUE(mac.ok()) << km::describe(mac.status);
        EXPECT_EQ(mac.value, expected_mac(msg));
    };

    {
        SCOPED_TRACE("bad requests on a connection that stays usable");
        RawClient raw(socket());
        ASSERT_TRUE(raw.connected());
        raw.send_bytes(Bytes{0, 0, 0, 0});
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "an empty body";
        raw.send_bytes(proto::FrameWriter(0x42).u32(1).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "an unknown kind";
        raw.send_bytes(proto::FrameWriter(proto::kOpenSession).u32(proto::kProtocolVersion).u8(0).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "a field too many";
        raw.send_bytes(open_frame(proto::kProtocolVersion + 1));
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_NOT_SUPPORTED) << "another protocol version";
        raw.send_bytes(proto::FrameWriter(proto::kNotifyFid).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "a notification without its fid";
        still_served();

        raw.send_bytes(open_frame());
        std::optional<Bytes> opened = raw.reply();
        ASSERT_TRUE(opened && opened->size() == 13);
        EXPECT_EQ((*opened)[0], proto::kOpenSession | proto::kReply);
        EXPECT_EQ(proto::frame_length(opened->data() + 1), TEE_SUCCESS);
        const uint32_t session = proto::frame_length(opened->data() + 9);

        auto invoke = [&](uint32_t s, uint32_t types) {
            return proto::FrameWriter(proto::kInvoke).u32(s).u32(1).u32(types);
        };
        raw.send_bytes(proto::FrameWriter(proto::kInvoke).u32(session).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "an invoke cut short";
        raw.send_bytes(invoke(session, 0x4).u32(0).u32(0).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_PARAMETERS) << "an undefined parameter type";
        raw.send_bytes(invoke(session, 0x10000).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_PARAMETERS) << "bits above the four types";
        raw.send_bytes(invoke(session, 0x6).u8(0).u32(proto::kMaxMemref + 1).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_EXCESS_DATA) << "an output above the memref cap";
        raw.send_bytes(invoke(session, 0x5).u8(0).u32(100).raw("0123456789", 10).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "an input shorter than its size";
        raw.send_bytes(invoke(session, 0x5).u8(2).u32(0).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "an unknown memref flag";
        raw.send_bytes(invoke(session, 0x3).u32(0).u32(0).u32(7).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_FORMAT) << "bytes after the last parameter";
        raw.send_bytes(invoke(session + 1000, 0x3).u32(0).u32(0).done());
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_BAD_STATE) << "a session of nobody's";
        still_served();

        // The same connection still gets real answers: 4 algorithms.
        raw.send_bytes(invoke(session, 0x3).u32(0).u32(0).done());
        std::optional<Bytes> count = raw.reply();
        ASSERT_TRUE(count && count->size() == 17);
        EXPECT_EQ(proto::frame_length(count->data() + 1), TEE_SUCCESS);
        EXPECT_EQ(proto::frame_length(count->data() + 9), 4u);
    }
    {
        SCOPED_TRACE("a length above the frame cap");
        RawClient raw(socket());
        Bytes huge(4);
        const uint32_t n = proto::kMaxFrame + 1;
        std::memcpy(huge.data(), &n, 4);
        raw.send_bytes(huge);
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_EXCESS_DATA);
        EXPECT_FALSE(raw.reply()) << "the connection stays open";
        still_served();
    }
    {
        SCOPED_TRACE("garbage");
        uint32_t x = 12345;
        Bytes junk(4096);
        for (uint8_t &b : junk)
            b = static_cast<uint8_t>((x = x * 1103515245u + 12345u) >> 16);
        RawClient framed(socket());
        Bytes frame = proto::FrameWriter(junk[0] | 0x10).raw(junk.data(), 64).done();
        framed.send_bytes(frame);
        EXPECT_EQ(framed.error_reply(), TEE_ERROR_BAD_FORMAT) << "a frame of garbage";
        RawClient raw(socket());
        junk[3] = 0xFF; // announces far more than the cap
        raw.send_bytes(junk);
        EXPECT_EQ(raw.error_reply(), TEE_ERROR_EXCESS_DATA);
        EXPECT_FALSE(raw.reply());
        still_served();
    }
    {
        SCOPED_TRACE("half a frame, then a disconnect");
        RawClient raw(socket());
        Bytes half = open_frame();
        half.resize(6);
        raw.send_bytes(half);
        raw.shut();
        still_served();
    }
    // Two that stall: half a frame left hanging, and a client that sends
    // requests with megabyte replies and never reads them.
    RawClient hanging(socket());
    Bytes half = open_frame();
    half.resize(7);
    hanging.send_bytes(half);
    RawClient deaf(socket());
    deaf.send_bytes(open_frame());
    std::optional<Bytes> deaf_session = deaf.reply();
    ASSERT_TRUE(deaf_session && deaf_session->size() == 13);
    // An unknown command leaves the 1 MiB in-out reference as it came, and
    // it all comes back: more than the socket holds. A second request waits behind it.
    Bytes request = proto::FrameWriter(proto::kInvoke)
                        .u32(proto::frame_length(deaf_session->data() + 9))
                        .u32(999)
                        .u32(0x7)
                        .u8(0)
                        .u32(proto::kMaxMemref)
                        .done();
    request.resize(request.size() + proto::kMaxMemref, 0xAB);
    const uint32_t request_len = static_cast<uint32_t>(request.size() - 4);
    std::memcpy(request.data(), &request_len, 4);
    deaf.send_bytes(request);
    deaf.send_bytes(open_frame());
    still_served();
    {
        SCOPED_TRACE("a frame a byte at a time, others served between the bytes");
        RawClient slow(socket());
        for (uint8_t byte : open_frame()) {
            slow.send_bytes(Bytes{byte});
            still_served();
        }
        std::optional<Bytes> opened = slow.reply();
        ASSERT_TRUE(opened && opened->size() == 13);
        EXPECT_EQ(proto::frame_length(opened->data() + 1), TEE_SUCCESS);
    }
    still_served();
    stopped(kmd);
}

TEST_F(KmdTest, OnlyItsOwnUserAndThoseAllowedMayConnect) {
    if (geteuid() != 0)
        GTEST_SKIP() << "needs root to connect as another user";
    constexpr uid_t kOther = 65534;
    // Where another user can reach the socket file at all.
    fs::permissions(dir_.path(), fs::perms::owner_all | fs::perms::others_exec | fs::perms::group_exec);
    auto connect_as_other = [&]() -> int {
        pid_t pid = fork();
        if (pid == 0) {
            if (setresgid(kOther, kOther, kOther) != 0 || setresuid(kOther, kOther, kOther) != 0)
                _exit(3);
            RawClient raw(socket());
            if (!raw.connected())
                _exit(4);
            raw.send_bytes(open_frame());
            std::optional<Bytes> r = raw.reply();
            _exit(!r ? 1 : (r->size() == 13 && proto::frame_length(r->data() + 1) == TEE_SUCCESS) ? 0 : 2);
        }
        return exit_code(pid);
    };
    {
        KmdProcess kmd(state(), socket());
        ASSERT_TRUE(kmd.up()) << kmd.log();
        fs::permissions(socket(), fs::perms::all);
        EXPECT_EQ(connect_as_other(), 1) << "kmd closes the connection unanswered";
        EXPECT_NE(stopped(kmd).find("refused a connection from uid 65534"), std::string::npos);
    }
    KmdProcess kmd(state(), socket(), {"--allow-uid", std::to_string(kOther)});
    ASSERT_TRUE(kmd.up()) << kmd.log();
    fs::permissions(socket(), fs::perms::all);
    EXPECT_EQ(connect_as_other(), 0);
    stopped(kmd);
}

// ---- the daemon as users meet it ----

TEST_F(KmdTest, DefaultSocketIsPrivateAndTheStateDirectoryHasOneTee) {
    const fs::path runtime = dir_.path() / "run";
    fs::create_directory(runtime);
    const fs::path sock = runtime / "kmd" / "kmd.sock";
    const std::string env = "XDG_RUNTIME_DIR=" + runtime.string();
    KmdProcess kmd(state(), sock, {}, {env}, true);
    ASSERT_TRUE(kmd.up()) << kmd.log();

    struct stat st {};
    ASSERT_EQ(stat(sock.parent_path().c_str(), &st), 0);
    EXPECT_EQ(st.st_mode & 07777, 0700u);
    ASSERT_EQ(stat(sock.c_str(), &st), 0);
    EXPECT_TRUE(S_ISSOCK(st.st_mode));
    EXPECT_EQ(st.st_mode & 07777, 0600u);

    // A second kmd and an embedded kmctl both refuse, naming the socket.
    const fs::path err = dir_.path() / "err";
    pid_t second = spawn({KMD_PATH, "--foreground", "--state", state().string()}, err, nullptr, {env});
    EXPECT_EQ(exit_code(second), 1);
    EXPECT_NE(read_file(err).find("another kmd serves the state directory " + state().string() + " on the socket " +
                                  sock.string()),
              std::string::npos)
        << read_file(err);
    pid_t embedded = spawn({KMCTL_PATH, "--state", state().string(), "info"}, err, nullptr, {}, {"KMCTL_SOCKET"});
    EXPECT_EQ(exit_code(embedded), 4);
    EXPECT_NE(read_file(err).find("kmd serves the state directory " + state().string() + " on the socket " +
                                  sock.string() + ": run kmctl with --socket " + sock.string()),
              std::string::npos)
        << read_file(err);

    // kmctl through kmd, by environment and by option.
    const fs::path blob = dir_.path() / "k.blob", msg = dir_.path() / "msg", mac = dir_.path() / "mac";
    std::ofstream(msg) << "through kmd";
    pid_t gen = spawn({KMCTL_PATH, "generate", "--algorithm", "hmac", "--size", "256", "--digest", "sha256",
                       "--min-mac-length", "256", "--out", blob.string()},
                      err, nullptr, {"KMCTL_SOCKET=" + sock.string()});
    EXPECT_EQ(exit_code(gen), 0) << read_file(err);
    pid_t sign = spawn({KMCTL_PATH, "--socket", sock.string(), "sign", "--key", blob.string(), "--in", msg.string(),
                        "--out", mac.string()},
                       err, nullptr, {}, {"KMCTL_SOCKET"});
    EXPECT_EQ(exit_code(sign), 0) << read_file(err);
    EXPECT_EQ(read_file(mac).size(), 32u);

    // SIGINT stops it cleanly: socket gone, directory free for the next TEE.
    const std::string log = stopped(kmd, SIGINT);
    EXPECT_FALSE(fs::exists(sock));
    int lock = open((state() / "kmd.lock").c_str(), O_RDONLY | O_CLOEXEC);
    EXPECT_EQ(flock(lock, LOCK_EX | LOCK_NB), 0);
    close(lock);
    EXPECT_NE(log.find("kmd: stopped"), std::string::npos) << log;
    // Every connection was logged with its peer's uid.
    EXPECT_NE(log.find("(uid " + std::to_string(geteuid()) + " pid "), std::string::npos) << log;

    // The embedded kmctl works again, with the key made through kmd.
    pid_t verify = spawn({KMCTL_PATH, "--state", state().string(), "verify", "--key", blob.string(), "--in",
                          msg.string(), "--signature", mac.string()},
                         err, nullptr, {}, {"KMCTL_SOCKET"});
    EXPECT_EQ(exit_code(verify), 0) << read_file(err);
}

TEST_F(KmdTest, ASocketLeftByAKilledKmdIsReplacedAndVersionIsPrinted) {
    {
        KmdProcess killed(state(), socket());
        ASSERT_TRUE(killed.up()) << killed.log();
        EXPECT_EQ(killed.stop(SIGKILL), 128 + SIGKILL);
    }
    ASSERT_TRUE(fs::exists(socket()));
    KmdProcess kmd(state(), socket());
    ASSERT_TRUE(kmd.up()) << kmd.log();
    Connection c(socket());
    EXPECT_EQ(c.opened, TEE_SUCCESS);
    // No fingerprint TA on an unprovisioned device, through kmd as in process.
    EXPECT_EQ(c.transport.notify_fid(3), TEE_ERROR_ITEM_NOT_FOUND);
    stopped(kmd);

    FILE *version = popen((std::string(KMD_PATH) + " --version").c_str(), "r");
    ASSERT_NE(version, nullptr);
    char line[64] = {};
    EXPECT_NE(fgets(line, sizeof line, version), nullptr);
    EXPECT_EQ(pclose(version), 0);
    EXPECT_STREQ(line, "kmd 0.1.0\n");
    pid_t usage = spawn({KMD_PATH, "--state", ""}, dir_.path() / "err");
    EXPECT_EQ(exit_code(usage), 2);
}

// ---- many clients, one TEE: the daemon's core in this process ----

// Whatever one client thread saw go wrong; empty when nothing did.
std::vector<std::string> client_thread(const fs::path &socket, int t, int commands, const Bytes &hmac_blob,
                                       const Bytes &rsa_blob, EVP_PKEY *rsa) {
    std::vector<std::string> wrong;
    auto expect = [&](bool ok, const std::string &what, const km::Status &s) {
        if (!ok && wrong.size() < 10)
            wrong.push_back("client " + std::to_string(t) + ": " + what + ": " + km::describe(s));
    };
    Connection c(socket);
    if (c.opened != TEE_SUCCESS)
        return {"client " + std::to_string(t) + " cannot open a session: " + c.transport.error()};
    // A signature of this client's own, made by OpenSSL, for the TA to check.
    const Bytes theirs_msg = text("checked by the TA for client " + std::to_string(t));
    Bytes theirs(256);
    size_t theirs_len = theirs.size();
    EVP_MD_CTX *md = EVP_MD_CTX_new();
    EVP_DigestSignInit(md, nullptr, EVP_sha256(), nullptr, rsa);
    EVP_DigestSign(md, theirs.data(), &theirs_len, theirs_msg.data(), theirs_msg.size());
    EVP_MD_CTX_free(md);
    // Each client generates keys of its own size: a crossed reply shows.
    const uint32_t own_size = 192 + 8 * static_cast<uint32_t>(t);

    int done = 0;
    for (int i = 0; done < commands; ++i) {
        const Bytes msg = text("client " + std::to_string(t) + " message " + std::to_string(i));
        if (i % 40 == 7) {
            km::Result<Bytes> sig = run(c.client, KM_PURPOSE_SIGN, rsa_blob, rsa_params(), msg);
            EVP_MD_CTX *v = EVP_MD_CTX_new();
            bool valid = sig.ok() && EVP_DigestVerifyInit(v, nullptr, EVP_sha256(), nullptr, rsa) == 1 &&
                         EVP_DigestVerify(v, sig.value.data(), sig.value.size(), msg.data(), msg.size()) == 1;
            EVP_MD_CTX_free(v);
            expect(valid, "an RSA signature OpenSSL accepts", sig.status);
            done += 3;
        } else if (i % 40 == 27) {
            km::Result<Bytes> r = run(c.client, KM_PURPOSE_VERIFY, rsa_blob, rsa_params(), theirs_msg, theirs);
            expect(r.ok(), "the TA accepting OpenSSL's RSA signature", r.status);
            done += 3;
        } else if (i % 50 == 13) {
            ParamSet p;
            p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_HMAC)
                .add(KM_TAG_KEY_SIZE, own_size)
                .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
                .add(KM_TAG_MIN_MAC_LENGTH, 128)
                .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
                .add_bool(KM_TAG_NO_AUTH_REQUIRED);
            km::Result<Bytes> blob = c.client.generate_key(p);
            expect(blob.ok(), "generate", blob.status);
            km::Result<ParamSet> chars = c.client.characteristics({blob.value, {}, {}});
            const km::Param *size = chars.value.find(KM_TAG_KEY_SIZE);
            expect(chars.ok() && size && size->value == own_size, "the generated key's own size", chars.status);
            done += 3;
        } else if (i % 4 == 3) {
            Bytes mac = expected_mac(msg);
            const bool forged = i % 8 == 7;
            if (forged)
                mac[i % mac.size()] ^= 1;
            km::Result<Bytes> r = run(c.client, KM_PURPOSE_VERIFY, hmac_blob, mac_params(), msg, mac);
            expect(forged ? r.status.km == KM_ERROR_VERIFICATION_FAILED : r.ok(),
                   forged ? "a forged MAC refused" : "a right MAC accepted", r.status);
            done += 3;
        } else {
            km::Result<Bytes> r = run(c.client, KM_PURPOSE_SIGN, hmac_blob, mac_params(), msg);
            expect(r.ok() && r.value == expected_mac(msg), "this message's own MAC", r.status);
            done += 3;
        }
    }
    return wrong;
}

TEST_F(KmdTest, EightClientsShareOneTeeWithoutLostOrCrossedReplies) {
    constexpr int kClients = 8;
    constexpr int kCommandsEach = 2500;
    std::unique_ptr<kmd::Daemon> daemon = in_process();
    std::thread server([&] { daemon->run(); });

    Bytes hmac_blob, rsa_blob;
    {
        Connection setup(socket());
        ASSERT_EQ(setup.opened, TEE_SUCCESS);
        hmac_blob = import_hmac(setup.client);
        std::string why;
        std::optional<Bytes> material = km::rsa_import_material(
            std::span(reinterpret_cast<const uint8_t *>(kRsa2048Pem), sizeof kRsa2048Pem - 1), &why);
        ASSERT_TRUE(material) << why;
        ParamSet p;
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN)
            .add(KM_TAG_PURPOSE, KM_PURPOSE_VERIFY)
            .add(KM_TAG_PADDING, KM_PAD_RSA_PKCS1_1_5_SIGN)
            .add(KM_TAG_DIGEST, KM_DIGEST_SHA_2_256)
            .add_bool(KM_TAG_NO_AUTH_REQUIRED);
        km::Result<km::ImportedKey> rsa = setup.client.import_key(p, *material);
        ASSERT_TRUE(rsa.ok()) << km::describe(rsa.status);
        rsa_blob = rsa.value.blob;
    }
    // Idle after first use: the key store keeps its keyed MAC operations from then on.
    ASSERT_TRUE(daemon->wait_for_connections(0, kDeadline));
    const tee_host::heap::Stats idle = tee_host::heap::stats();
    const size_t idle_objects = tee_host::handles::live_objects();
    const size_t idle_operations = tee_host::handles::live_operations();
    const uint8_t *pem = reinterpret_cast<const uint8_t *>(kRsa2048Pem);
    BIO *bio = BIO_new_mem_buf(pem, static_cast<int>(sizeof kRsa2048Pem - 1));
    EVP_PKEY *rsa = PEM_read_bio_PrivateKey(bio, nullptr, nullptr, nullptr);
    BIO_free(bio);
    ASSERT_NE(rsa, nullptr);

    std::vector<std::vector<std::string>> wrong(kClients);
    std::vector<std::thread> clients;
    for (int t = 0; t < kClients; ++t)
        clients.emplace_back(
            [&, t] { wrong[t] = client_thread(socket(), t, kCommandsEach, hmac_blob, rsa_blob, rsa); });
    for (std::thread &c : clients)
        c.join();
    EVP_PKEY_free(rsa);
    for (const auto &w : wrong)
        for (const std::string &line : w)
            ADD_FAILURE() << line;

    // Every client gone and cleaned up after: the TA holds what it held idle.
    EXPECT_TRUE(daemon->wait_for_connections(0, kDeadline));
    const tee_host::heap::Stats after = tee_host::heap::stats();
    EXPECT_EQ(after.live_count, idle.live_count);
    EXPECT_EQ(after.live_bytes, idle.live_bytes);
    EXPECT_EQ(tee_host::handles::live_objects(), idle_objects);
    EXPECT_EQ(tee_host::handles::live_operations(), idle_operations);

    daemon->stop();
    server.join();
    daemon.reset();
    expect_ended();
}

// The fingerprint TA beside kmd's TA: a finger reported through one
// connection goes into the statements another connection has signed, for
// 3000 ms of TEE time (frozen here, so the test moves it).
TEST_F(KmdTest, AFingerprintReportedThroughKmdIsFreshForEveryClient) {
    tee_host::provisioning::FactoryData d = factory_key(kRsa2048Pem);
    d.sensor_name = "sensor";
    d.sensor_version = "1";
    d.cpu_id = "cpu";
    d.fp_ta_uuid = trusted_client_uuids[0];
    ASSERT_EQ(tee_host::provisioning::store(state(), d, false), tee_host::provisioning::StoreResult::stored);
    std::unique_ptr<kmd::Daemon> daemon = in_process();
    tee_host::clock::freeze();
    std::thread server([&] { daemon->run(); });
    {
        Connection a(socket());
        Connection b(socket());
        ASSERT_EQ(a.opened, TEE_SUCCESS);
        ASSERT_EQ(b.opened, TEE_SUCCESS);
        ParamSet p = rsa_params();
        p.add(KM_TAG_ALGORITHM, KM_ALGORITHM_RSA).add(KM_TAG_PURPOSE, KM_PURPOSE_SIGN);
        p.add_bool(KM_TAG_NO_AUTH_REQUIRED).add_bool(KM_TAG_SOTER_IS_FROM_SOTER);
        std::string why;
        std::optional<Bytes> material = km::rsa_import_material(
            std::span(reinterpret_cast<const uint8_t *>(kRsa1024Pem), sizeof kRsa1024Pem - 1), &why);
        ASSERT_TRUE(material) << why;
        km::Result<km::ImportedKey> key = b.client.import_key(p, *material);
        ASSERT_TRUE(key.ok()) << km::describe(key.status);

        // Not taken until the SOTER state is loaded; then taken.
        EXPECT_EQ(a.client.notify_fid(4).tee, TEE_ERROR_ACCESS_DENIED);
        ASSERT_TRUE(a.client.soter_load_attk().ok());
        ASSERT_TRUE(a.client.notify_fid(4).ok());
        const Bytes challenge = {'c', 'h'};
        tee_host::clock::advance_system_ms(3000);
        km::Result<Bytes> fresh = run(b.client, KM_PURPOSE_SIGN, key.value.blob, rsa_params(), challenge);
        ASSERT_TRUE(fresh.ok()) << km::describe(fresh.status);
        const std::string with(fresh.value.begin(), fresh.value.end());
        EXPECT_NE(with.find("\"fid\":4,"), std::string::npos) << with;
        tee_host::clock::advance_system_ms(1);
        km::Result<Bytes> stale = run(b.client, KM_PURPOSE_SIGN, key.value.blob, rsa_params(), challenge);
        ASSERT_TRUE(stale.ok());
        EXPECT_EQ(std::string(stale.value.begin(), stale.value.end()).find("\"fid\""), std::string::npos);
    }
    daemon->stop();
    server.join();
    daemon.reset();
    tee_host::clock::unfreeze();
    expect_ended();
}

TEST_F(KmdTest, StoppingAbortsLiveOperationsAndEndsTheTaCleanly) {
    std::unique_ptr<kmd::Daemon> daemon = in_process();
    std::thread server([&] { daemon->run(); });
    {
        Connection c(socket());
        const Bytes blob = import_hmac(c.client);
        for (int i = 0; i < 5; ++i)
            ASSERT_TRUE(c.client.begin(KM_PURPOSE_SIGN, blob, mac_params()).ok());
        ASSERT_TRUE(daemon->wait_for_connections(1, kDeadline));
        daemon->stop();
        server.join();
        // Stopped with the client still connected and five operations live.
        daemon.reset();
        EXPECT_EQ(c.client.begin(KM_PURPOSE_SIGN, blob, mac_params()).status.tee, TEE_ERROR_COMMUNICATION);
    }
    expect_ended();
}

// ---- embedded kmctl runs on one state directory ----

TEST_F(KmdTest, ASecondEmbeddedKmctlWaitsForTheFirst) {
    const fs::path err = dir_.path() / "err", key = dir_.path() / "k.blob", fifo = dir_.path() / "in";
    const std::vector<std::string> no_socket = {"KMCTL_SOCKET"};
    pid_t gen = spawn({KMCTL_PATH, "--state", state().string(), "generate", "--algorithm", "hmac", "--size", "256",
                       "--digest", "sha256", "--min-mac-length", "256", "--out", key.string()},
                      err, nullptr, {}, no_socket);
    ASSERT_EQ(exit_code(gen), 0) << read_file(err);
    ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);

    // The first holds the directory while it waits for its input.
    int first_err = -1;
    pid_t first = spawn({KMCTL_PATH, "--state", state().string(), "--log-level", "info", "sign", "--key", key.string(),
                         "--in", fifo.string(), "--out", (dir_.path() / "mac1").string()},
                        {}, &first_err, {}, no_socket);
    int input = open(fifo.c_str(), O_WRONLY | O_CLOEXEC);
    ASSERT_GE(input, 0);
    std::string first_text;
    ASSERT_TRUE(read_until(first_err, &first_text, ": begin")) << first_text;

    int second_err = -1;
    pid_t second = spawn({KMCTL_PATH, "--state", state().string(), "generate", "--algorithm", "hmac", "--size", "256",
                          "--digest", "sha256", "--min-mac-length", "256", "--out", (dir_.path() / "k2.blob").string()},
                         {}, &second_err, {}, no_socket);
    std::string second_text;
    EXPECT_TRUE(read_until(second_err, &second_text,
                           "kmctl: waiting for another kmctl using the state directory " + state().string()))
        << second_text;
    int status = 0;
    EXPECT_EQ(waitpid(second, &status, WNOHANG), 0) << "the second ran while the first held the directory";
    EXPECT_FALSE(fs::exists(dir_.path() / "k2.blob"));

    ASSERT_EQ(write(input, "message", 7), 7);
    close(input);
    EXPECT_EQ(exit_code(first), 0) << first_text;
    EXPECT_EQ(exit_code(second), 0) << second_text;
    EXPECT_TRUE(fs::exists(dir_.path() / "k2.blob"));
    EXPECT_EQ(read_file(dir_.path() / "mac1").size(), 32u);
    close(first_err);
    close(second_err);
}

TEST_F(KmdTest, EmbeddedKmctlsStartedTogetherMakeOneKeyStoreKey) {
    constexpr int kRuns = 8;
    const std::vector<std::string> no_socket = {"KMCTL_SOCKET"};
    auto all_at_once = [&](const std::function<std::vector<std::string>(int)> &args) {
        std::vector<pid_t> pids;
        for (int i = 0; i < kRuns; ++i) {
            std::vector<std::string> argv = {KMCTL_PATH, "--state", state().string()};
            for (std::string &a : args(i))
                argv.push_back(a);
            pids.push_back(spawn(argv, dir_.path() / ("err" + std::to_string(i)), nullptr, {}, no_socket));
        }
        for (int i = 0; i < kRuns; ++i)
            EXPECT_EQ(exit_code(pids[i]), 0) << read_file(dir_.path() / ("err" + std::to_string(i)));
    };
    auto key = [&](int i) { return (dir_.path() / ("k" + std::to_string(i))).string(); };
    std::ofstream(dir_.path() / "msg") << "message";
    all_at_once([&](int i) {
        return std::vector<std::string>{"generate", "--algorithm",      "hmac", "--size", "256", "--digest",
                                        "sha256",   "--min-mac-length", "256",  "--out",  key(i)};
    });
    // One key-store key, whole: every blob opens and signs afterwards.
    std::string ksk_name;
    for (char ch : std::string("Keymaster KSK") + '\0') {
        char hex[3];
        std::snprintf(hex, sizeof hex, "%02x", static_cast<uint8_t>(ch));
        ksk_name += hex;
    }
    std::vector<std::string> files;
    for (const auto &entry : fs::directory_iterator(state() / "storage" / "rpmb"))
        files.push_back(entry.path().filename().string());
    EXPECT_EQ(files, std::vector<std::string>{ksk_name + ".obj"});
    all_at_once([&](int i) {
        return std::vector<std::string>{"sign",  "--key",        key(i), "--in", (dir_.path() / "msg").string(),
                                        "--out", key(i) + ".mac"};
    });
    for (int i = 0; i < kRuns; ++i)
        EXPECT_EQ(read_file(key(i) + ".mac").size(), 32u) << i;
}

} // namespace
