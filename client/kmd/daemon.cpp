/*
 * daemon.cpp - kmd's event loop: accepting clients, reading whole frames
 * without blocking, handing each request to the TEE in turn, and cleaning
 * up after clients that leave.
 */
#include "daemon.h"

#include <atomic>
#include <cerrno>
#include <condition_variable>
#include <cstdio>
#include <cstring>
#include <map>
#include <mutex>
#include <set>
#include <string>
#include <unordered_map>

#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include "km/kmd_protocol.h"
#include "km/names.h"
#include "ta_entry.h"
#include "tee_host.h"

namespace kmd {
namespace {

namespace proto = km::kmd;

constexpr size_t kMaxConnections = 128;
// Bytes read from one client per turn, so that a fast sender cannot
// starve the others.
constexpr size_t kReadChunk = 64 * 1024;
constexpr size_t kReadPerTurn = 4 * kReadChunk;

// The types words with which the operation commands pass the dispatcher.
constexpr uint32_t kOperationTypes = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_MEMREF_INPUT,
                                                     TEE_PARAM_TYPE_MEMREF_OUTPUT, TEE_PARAM_TYPE_NONE);
constexpr uint32_t kAbortTypes =
    TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE, TEE_PARAM_TYPE_NONE);

struct Connection {
    uint64_t id = 0;
    int fd = -1;
    uid_t uid = 0;
    pid_t pid = 0;
    std::vector<uint8_t> in;  // received, not yet handled
    std::vector<uint8_t> out; // replies not yet sent
    size_t sent = 0;          // of out
    bool peer_done = false;   // the client shut its side: answer what came, then close
    bool closing = false;     // close once out is sent
    bool dead = false;        // drop at the next chance
    std::vector<uint32_t> sessions;
    std::set<uint32_t> operations; // handles begun here and still live

    bool out_pending() const { return sent < out.size(); }
    bool has_frame() const { return in.size() >= 4 && in.size() - 4 >= proto::frame_length(in.data()); }
    std::string name() const {
        return "connection " + std::to_string(id) + " (uid " + std::to_string(uid) + " pid " + std::to_string(pid) +
               ")";
    }
};

std::string result_name(TEE_Result r) {
    char hex[16] = {};
    std::snprintf(hex, sizeof hex, "0x%08x", r);
    return km::tee_result_name(r) + " (" + hex + ")";
}

// Fd - a descriptor closed with its owner.
struct Fd {
    int fd = -1;
    Fd() = default;
    Fd(const Fd &) = delete;
    Fd &operator=(const Fd &) = delete;
    ~Fd() {
        if (fd >= 0)
            ::close(fd);
    }
};

} // namespace

struct Daemon::Impl {
    explicit Impl(Options o);
    ~Impl();

    void log(int level, const std::string &line) const {
        if (level <= options.log_level) {
            const std::string text = "kmd: " + line + "\n";
            std::fputs(text.c_str(), stderr);
        }
    }

    void accept_all();
    void receive(Connection &c);
    void flush(Connection &c);
    void queue(Connection &c, std::vector<uint8_t> frame);
    void refuse(Connection &c, TEE_Result why, const std::string &what);
    void serve_one(Connection &c);
    void open_session(Connection &c, proto::FrameReader &body);
    void close_session(Connection &c, proto::FrameReader &body);
    void invoke(Connection &c, proto::FrameReader &body);
    void notify_fid(Connection &c, proto::FrameReader &body);
    void track(Connection &c, const proto::InvokeCall &call, uint32_t a_in, uint32_t b_in, TEE_Result res);
    void forget(uint32_t handle);
    void drop(uint64_t id);
    void drop_dead();

    Options options;
    StateClaim claim;
    Fd wake_read, wake_write; // stop() wakes the loop through this pipe
    std::atomic<bool> stopping{false};
    std::unique_ptr<tee_host::Tee> tee;
    uint32_t anchor = 0; // kmd's own session: the TA instance lives as long as it
    std::unique_ptr<Listener> listener;
    std::map<uint64_t, std::unique_ptr<Connection>> conns; // in accept order: turns go round it
    std::unordered_map<uint32_t, Connection *> owners;     // live operation handle: who began it
    // How many connections there are, for other threads.
    mutable std::mutex live_mu;
    mutable std::condition_variable live_cv;
    size_t live = 0;
    uint64_t next_id = 1;

    void count_connections() {
        {
            std::lock_guard<std::mutex> lock(live_mu);
            live = conns.size();
        }
        live_cv.notify_all();
    }
};

Daemon::Impl::Impl(Options o) : options(std::move(o)), claim(options.state_dir) {
    int pipe_fds[2] = {-1, -1};
    if (::pipe2(pipe_fds, O_CLOEXEC | O_NONBLOCK) != 0)
        throw StartError(std::string("cannot create a pipe: ") + std::strerror(errno));
    wake_read.fd = pipe_fds[0];
    wake_write.fd = pipe_fds[1];
    if (tee_host::Tee::current())
        throw StartError("a TEE is already running in this process");
    tee_host::Config config;
    config.state_dir = options.state_dir;
    config.trace_level = options.log_level;
    tee = std::make_unique<tee_host::Tee>(config);
    tee->install_ta(&keymaster_ta_header);
    // The boot starts here: the TA instance is created with this session
    // and ends only when kmd closes it.
    TEE_Result res = tee->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &anchor);
    if (res != TEE_SUCCESS)
        throw StartError("the Keymaster TA does not start on the state directory " + options.state_dir.string() + ": " +
                         result_name(res));
    const bool private_dir = options.socket.empty();
    listener =
        std::make_unique<Listener>(private_dir ? default_socket(options.state_dir) : options.socket, private_dir);
    claim.serving(listener->path());
    log(TEE_TRACE_ERROR, "serving the state directory " + options.state_dir.string() + " on the socket " +
                             listener->path().string() + " (pid " + std::to_string(::getpid()) + ")");
}

Daemon::Impl::~Impl() {
    // No new clients, then none of the old ones.
    listener.reset();
    while (!conns.empty())
        drop(conns.begin()->first);
    if (tee && anchor != 0) {
        tee->close_session(anchor);
        const size_t blocks = tee_host::heap::leaks_at_last_destroy().size();
        const size_t handles = tee_host::handles::leaked_at_last_destroy();
        if (blocks || handles)
            log(TEE_TRACE_ERROR, "the TA left " + std::to_string(blocks) + " heap blocks and " +
                                     std::to_string(handles) + " handles at its end");
    }
    tee.reset();
    log(TEE_TRACE_ERROR, "stopped");
}

void Daemon::Impl::accept_all() {
    for (;;) {
        int fd = ::accept4(listener->fd(), nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            if (errno != EAGAIN && errno != EWOULDBLOCK)
                log(TEE_TRACE_ERROR, std::string("cannot accept a connection: ") + std::strerror(errno));
            return;
        }
        ucred cred{};
        socklen_t len = sizeof cred;
        if (::getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &cred, &len) != 0) {
            log(TEE_TRACE_ERROR, std::string("refused a connection: its peer is unknown: ") + std::strerror(errno));
            ::close(fd);
            continue;
        }
        const std::string peer = "uid " + std::to_string(cred.uid) + " pid " + std::to_string(cred.pid);
        bool allowed = cred.uid == ::geteuid();
        for (uid_t u : options.allowed_uids)
            allowed = allowed || cred.uid == u;
        if (!allowed) {
            log(TEE_TRACE_ERROR, "refused a connection from " + peer + ": only uid " + std::to_string(::geteuid()) +
                                     " and those given with --allow-uid may connect");
            ::close(fd);
            continue;
        }
        if (conns.size() >= kMaxConnections) {
            log(TEE_TRACE_ERROR,
                "refused a connection from " + peer + ": already " + std::to_string(kMaxConnections) + " clients");
            ::close(fd);
            continue;
        }
        auto c = std::make_unique<Connection>();
        c->id = next_id++;
        c->fd = fd;
        c->uid = cred.uid;
        c->pid = cred.pid;
        log(TEE_TRACE_INFO, c->name() + " opened");
        conns.emplace(c->id, std::move(c));
        count_connections();
    }
}

void Daemon::Impl::receive(Connection &c) {
    uint8_t buf[kReadChunk];
    size_t taken = 0;
    // Only up to a whole frame: the rest waits in the socket until that
    // frame is answered.
    while (taken < kReadPerTurn && !c.has_frame() && !c.closing) {
        ssize_t r = ::recv(c.fd, buf, sizeof buf, MSG_DONTWAIT);
        if (r == 0) {
            c.peer_done = true;
            return;
        }
        if (r < 0) {
            if (errno == EINTR)
                continue;
            if (errno != EAGAIN && errno != EWOULDBLOCK)
                c.dead = true;
            return;
        }
        c.in.insert(c.in.end(), buf, buf + r);
        taken += static_cast<size_t>(r);
        if (c.in.size() >= 4 && proto::frame_length(c.in.data()) > proto::kMaxFrame) {
            // Nothing can be skipped safely: answer and close.
            refuse(c, TEE_ERROR_EXCESS_DATA,
                   "a frame of " + std::to_string(proto::frame_length(c.in.data())) + " bytes");
            c.in.clear();
            c.closing = true;
        }
    }
}

void Daemon::Impl::flush(Connection &c) {
    while (c.out_pending()) {
        ssize_t w = ::send(c.fd, c.out.data() + c.sent, c.out.size() - c.sent, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (w > 0) {
            c.sent += static_cast<size_t>(w);
            continue;
        }
        if (w < 0 && errno == EINTR)
            continue;
        if (w < 0 && (errno == EAGAIN || errno == EWOULDBLOCK))
            return;
        c.dead = true;
        return;
    }
    c.out.clear();
    c.sent = 0;
}

void Daemon::Impl::queue(Connection &c, std::vector<uint8_t> frame) {
    if (c.out.empty()) {
        c.out = std::move(frame);
        c.sent = 0;
    } else {
        c.out.insert(c.out.end(), frame.begin(), frame.end());
    }
    flush(c);
}

void Daemon::Impl::refuse(Connection &c, TEE_Result why, const std::string &what) {
    log(TEE_TRACE_ERROR, c.name() + ": refused " + what + ": " + result_name(why));
    queue(c, proto::FrameWriter(proto::kError).u32(why).u32(TEE_ORIGIN_TEE).done());
}

void Daemon::Impl::serve_one(Connection &c) {
    const uint32_t len = proto::frame_length(c.in.data());
    proto::FrameReader body(c.in.data() + 4, len);
    const uint8_t kind = body.u8();
    if (!body.ok())
        refuse(c, TEE_ERROR_BAD_FORMAT, "an empty frame");
    else if (kind == proto::kOpenSession)
        open_session(c, body);
    else if (kind == proto::kCloseSession)
        close_session(c, body);
    else if (kind == proto::kInvoke)
        invoke(c, body);
    else if (kind == proto::kNotifyFid)
        notify_fid(c, body);
    else
        refuse(c, TEE_ERROR_BAD_FORMAT, "a frame of unknown kind " + std::to_string(kind));
    c.in.erase(c.in.begin(), c.in.begin() + 4 + static_cast<std::ptrdiff_t>(len));
}

void Daemon::Impl::open_session(Connection &c, proto::FrameReader &body) {
    const uint32_t version = body.u32();
    if (!body.finished())
        return refuse(c, TEE_ERROR_BAD_FORMAT, "a malformed open-session request");
    if (version != proto::kProtocolVersion)
        return refuse(c, TEE_ERROR_NOT_SUPPORTED, "protocol version " + std::to_string(version));
    if (c.sessions.size() >= proto::kMaxSessionsPerConnection)
        return refuse(c, TEE_ERROR_BUSY, "a session beyond " + std::to_string(proto::kMaxSessionsPerConnection));
    uint32_t session = 0;
    TEE_Result res = tee->open_session(keymaster_ta_uuid, tee_host::normal_world_identity(), 0, nullptr, &session);
    if (res == TEE_SUCCESS)
        c.sessions.push_back(session);
    queue(c, proto::FrameWriter(proto::kOpenSession | proto::kReply)
                 .u32(res)
                 .u32(TEE_ORIGIN_TRUSTED_APP)
                 .u32(res == TEE_SUCCESS ? session : 0)
                 .done());
}

void Daemon::Impl::close_session(Connection &c, proto::FrameReader &body) {
    const uint32_t session = body.u32();
    if (!body.finished())
        return refuse(c, TEE_ERROR_BAD_FORMAT, "a malformed close-session request");
    // Only the connection's own sessions: closing is silent about others, as the GP API's is.
    for (auto it = c.sessions.begin(); it != c.sessions.end(); ++it) {
        if (*it != session)
            continue;
        tee->close_session(session);
        c.sessions.erase(it);
        break;
    }
    queue(c, proto::FrameWriter(proto::kCloseSession | proto::kReply).u32(TEE_SUCCESS).u32(TEE_ORIGIN_TEE).done());
}

void Daemon::Impl::invoke(Connection &c, proto::FrameReader &body) {
    proto::InvokeCall call;
    TEE_Result res = proto::decode_invoke(body, &call);
    if (res != TEE_SUCCESS)
        return refuse(c, res, "a malformed invoke request");
    bool own = false;
    for (uint32_t s : c.sessions)
        own = own || s == call.session;
    if (!own)
        return refuse(c, TEE_ERROR_BAD_STATE, "an invoke on session " + std::to_string(call.session));
    const uint32_t a_in = call.params[0].value.a;
    const uint32_t b_in = call.params[0].value.b;
    res = tee->invoke(call.session, call.command, call.types, call.params);
    track(c, call, a_in, b_in, res);
    queue(c, proto::encode_invoke_reply(res, TEE_ORIGIN_TRUSTED_APP, call));
}

// Keeps the record of which connection began which live operation, from
// what the operation commands did: begin makes one, a failed update, any
// finish and abort end one. Calls the dispatcher refused (wrong types, a
// nonzero b) touch nothing.
void Daemon::Impl::track(Connection &c, const proto::InvokeCall &call, uint32_t a_in, uint32_t b_in, TEE_Result res) {
    const TEE_Param &p0 = call.params[0];
    const bool dispatched = b_in == 0 && call.types == (call.command == KM_CMD_ABORT ? kAbortTypes : kOperationTypes);
    if (!dispatched)
        return;
    switch (call.command) {
    case KM_CMD_BEGIN:
        if (res == TEE_SUCCESS && p0.value.a == 0 && p0.value.b != 0) {
            forget(p0.value.b); // a stale record of an ended operation
            owners[p0.value.b] = &c;
            c.operations.insert(p0.value.b);
        }
        break;
    case KM_CMD_UPDATE:
        if (res != TEE_SUCCESS || p0.value.a != 0)
            forget(a_in);
        break;
    case KM_CMD_FINISH:
    case KM_CMD_ABORT:
        forget(a_in);
        break;
    default:
        break;
    }
}

void Daemon::Impl::forget(uint32_t handle) {
    auto it = owners.find(handle);
    if (it == owners.end())
        return;
    it->second->operations.erase(handle);
    owners.erase(it);
}

void Daemon::Impl::notify_fid(Connection &c, proto::FrameReader &body) {
    const uint32_t fid = body.u32();
    if (!body.finished())
        return refuse(c, TEE_ERROR_BAD_FORMAT, "a malformed fingerprint notification");
    TEE_Result res = tee_host::fingerprint::notify(keymaster_ta_uuid, fid);
    log(TEE_TRACE_INFO, c.name() + ": fingerprint " + std::to_string(fid) + " notified: " + result_name(res));
    queue(c, proto::FrameWriter(proto::kNotifyFid | proto::kReply).u32(res).u32(TEE_ORIGIN_TEE).done());
}

// Ends what a departed client left: its operations (any session may abort
// a handle; kmd's own does) and its sessions.
void Daemon::Impl::drop(uint64_t id) {
    auto it = conns.find(id);
    if (it == conns.end())
        return;
    Connection &c = *it->second;
    const size_t orphans = c.operations.size();
    for (uint32_t handle : c.operations) {
        TEE_Param params[4] = {};
        params[0].value.a = handle;
        tee->invoke(anchor, KM_CMD_ABORT, kAbortTypes, params);
        owners.erase(handle);
    }
    for (uint32_t session : c.sessions)
        tee->close_session(session);
    ::close(c.fd);
    std::string aborted;
    if (orphans)
        aborted =
            "; aborted " + std::to_string(orphans) + (orphans == 1 ? " operation" : " operations") + " it left running";
    log(TEE_TRACE_INFO, c.name() + " closed" + aborted);
    conns.erase(it);
    count_connections();
}

void Daemon::Impl::drop_dead() {
    std::vector<uint64_t> dead;
    for (auto &[id, c] : conns)
        if (c->dead)
            dead.push_back(id);
    for (uint64_t id : dead)
        drop(id);
}

Daemon::Daemon(Options options) : impl_(std::make_unique<Impl>(std::move(options))) {}

Daemon::~Daemon() = default;

const std::filesystem::path &Daemon::socket() const {
    return impl_->listener->path();
}

size_t Daemon::connections() const {
    std::lock_guard<std::mutex> lock(impl_->live_mu);
    return impl_->live;
}

bool Daemon::wait_for_connections(size_t n, std::chrono::milliseconds timeout) const {
    std::unique_lock<std::mutex> lock(impl_->live_mu);
    return impl_->live_cv.wait_for(lock, timeout, [&] { return impl_->live == n; });
}

void Daemon::stop() {
    impl_->stopping.store(true);
    const char byte = 1;
    // A full pipe already holds a wake-up.
    [[maybe_unused]] ssize_t w = ::write(impl_->wake_write.fd, &byte, 1);
}

void Daemon::run() {
    Impl &d = *impl_;
    std::vector<pollfd> fds;
    std::vector<Connection *> polled;
    while (!d.stopping.load()) {
        fds.clear();
        polled.clear();
        fds.push_back({d.wake_read.fd, POLLIN, 0});
        fds.push_back({d.listener->fd(), POLLIN, 0});
        bool work_waiting = false;
        for (auto &[id, c] : d.conns) {
            short events = 0;
            if (c->out_pending())
                events = POLLOUT;
            else if (c->has_frame() && !c->closing)
                work_waiting = true;
            else if (!c->peer_done && !c->closing)
                events = POLLIN;
            fds.push_back({c->fd, events, 0});
            polled.push_back(c.get());
        }
        if (::poll(fds.data(), fds.size(), work_waiting ? 0 : -1) < 0) {
            if (errno == EINTR)
                continue;
            d.log(TEE_TRACE_ERROR, std::string("poll failed: ") + std::strerror(errno));
            return;
        }
        if (fds[0].revents) {
            char drain[64];
            while (::read(d.wake_read.fd, drain, sizeof drain) > 0) {
            }
        }
        // Departures first, so that a client that died before another sent
        // its request is cleaned up before that request is served.
        for (size_t i = 0; i < polled.size(); ++i) {
            Connection &c = *polled[i];
            const short re = fds[i + 2].revents;
            if (re & (POLLHUP | POLLERR)) {
                c.dead = true;
                continue;
            }
            if (re & POLLOUT)
                d.flush(c);
            if (re & POLLIN)
                d.receive(c);
        }
        d.drop_dead();
        if (fds[1].revents & POLLIN)
            d.accept_all();
        // One request per client per turn.
        for (auto &[id, c] : d.conns) {
            if (!c->out_pending() && c->has_frame() && !c->closing)
                d.serve_one(*c);
            const bool answered = !c->out_pending() && !c->has_frame();
            if (answered && (c->closing || c->peer_done))
                c->dead = true;
        }
        d.drop_dead();
    }
}

} // namespace kmd
