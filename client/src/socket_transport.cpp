/*
 * socket_transport.cpp - the client's end of a kmd connection.
 */
#include "km/socket_transport.h"

#include <cerrno>
#include <cstring>

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include "km/kmd_protocol.h"
#include "tee_api_defines.h"

namespace km {
namespace {

bool send_all(int fd, const uint8_t *p, size_t n) {
    while (n > 0) {
        ssize_t w = ::send(fd, p, n, MSG_NOSIGNAL);
        if (w < 0 && errno == EINTR)
            continue;
        if (w <= 0)
            return false;
        p += w;
        n -= static_cast<size_t>(w);
    }
    return true;
}

// recv_all - exactly n bytes; errno is 0 when the peer closed first.
bool recv_all(int fd, uint8_t *p, size_t n) {
    while (n > 0) {
        ssize_t r = ::recv(fd, p, n, 0);
        if (r < 0 && errno == EINTR)
            continue;
        if (r <= 0) {
            if (r == 0)
                errno = 0;
            return false;
        }
        p += r;
        n -= static_cast<size_t>(r);
    }
    return true;
}

// Where a reply's own fields start: after kind, result and origin.
constexpr size_t kReplyFields = 9;

std::string reason(int err) {
    return err ? std::strerror(err) : "kmd closed the connection";
}

} // namespace

SocketTransport::SocketTransport(std::filesystem::path socket) : socket_(std::move(socket)) {}

SocketTransport::~SocketTransport() {
    close();
}

std::string SocketTransport::error() const {
    std::lock_guard<std::mutex> lock(mu_);
    return error_;
}

bool SocketTransport::connect_locked() {
    if (fd_ >= 0)
        return true;
    sockaddr_un addr{};
    addr.sun_family = AF_UNIX;
    const std::string path = socket_.string();
    if (path.empty() || path.size() >= sizeof addr.sun_path) {
        error_ = "cannot connect to kmd on " + path + ": the socket path is empty or too long";
        return false;
    }
    std::memcpy(addr.sun_path, path.c_str(), path.size() + 1);
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        error_ = "cannot connect to kmd on " + path + ": " + std::strerror(errno);
        return false;
    }
    int res = 0;
    while ((res = ::connect(fd, reinterpret_cast<const sockaddr *>(&addr), sizeof addr)) != 0 && errno == EINTR) {
    }
    if (res != 0) {
        error_ = "cannot connect to kmd on " + path + ": " + std::strerror(errno);
        ::close(fd);
        return false;
    }
    fd_ = fd;
    error_.clear();
    return true;
}

void SocketTransport::disconnect_locked(const std::string &why) {
    if (!why.empty())
        error_ = why;
    if (fd_ >= 0)
        ::close(fd_);
    fd_ = -1;
    session_ = 0;
}

// Sends the request and reads one reply into reply_. On TEE_SUCCESS the
// reply has the expected kind, *result is its result and its own fields
// start at kReplyFields; a kError reply returns its result. A broken
// connection or a reply of the wrong shape drops the connection and
// returns TEE_ERROR_COMMUNICATION.
TEE_Result SocketTransport::exchange_locked(const std::vector<uint8_t> &request, uint8_t kind, TEE_Result *result) {
    if (!connect_locked())
        return TEE_ERROR_COMMUNICATION;
    if (!send_all(fd_, request.data(), request.size())) {
        disconnect_locked("lost the connection to kmd on " + socket_.string() + ": " + reason(errno));
        return TEE_ERROR_COMMUNICATION;
    }
    uint8_t head[4] = {};
    if (!recv_all(fd_, head, sizeof head)) {
        disconnect_locked("lost the connection to kmd on " + socket_.string() + ": " + reason(errno));
        return TEE_ERROR_COMMUNICATION;
    }
    const uint32_t n = kmd::frame_length(head);
    if (n < kReplyFields || n > kmd::kMaxFrame) {
        disconnect_locked("kmd on " + socket_.string() + " sent a reply of a wrong length");
        return TEE_ERROR_COMMUNICATION;
    }
    reply_.resize(n);
    if (!recv_all(fd_, reply_.data(), n)) {
        disconnect_locked("lost the connection to kmd on " + socket_.string() + ": " + reason(errno));
        return TEE_ERROR_COMMUNICATION;
    }
    kmd::FrameReader r(reply_.data(), reply_.size());
    const uint8_t got = r.u8();
    *result = r.u32();
    r.u32(); // the origin: the Transport interface reports results only
    if (got == kmd::kError && *result != TEE_SUCCESS && r.finished()) {
        // kmd closes the connection after a frame it cannot skip.
        if (*result == TEE_ERROR_EXCESS_DATA)
            disconnect_locked("kmd on " + socket_.string() + " refused an oversized request");
        return *result;
    }
    if (got != (kind | kmd::kReply)) {
        disconnect_locked("kmd on " + socket_.string() + " sent a reply of another kind");
        return TEE_ERROR_COMMUNICATION;
    }
    return TEE_SUCCESS;
}

kmd::FrameReader SocketTransport::fields() const {
    return kmd::FrameReader(reply_.data() + kReplyFields, reply_.size() - kReplyFields);
}

TEE_Result SocketTransport::open() {
    std::lock_guard<std::mutex> lock(mu_);
    if (session_ != 0)
        return TEE_ERROR_BAD_STATE;
    TEE_Result opened = TEE_SUCCESS;
    TEE_Result res = exchange_locked(kmd::FrameWriter(kmd::kOpenSession).u32(kmd::kProtocolVersion).done(),
                                     kmd::kOpenSession, &opened);
    if (res != TEE_SUCCESS)
        return res;
    kmd::FrameReader r = fields();
    const uint32_t session = r.u32();
    if (!r.finished() || (opened == TEE_SUCCESS && session == 0)) {
        disconnect_locked("kmd on " + socket_.string() + " sent a malformed reply");
        return TEE_ERROR_COMMUNICATION;
    }
    if (opened == TEE_SUCCESS)
        session_ = session;
    return opened;
}

TEE_Result SocketTransport::invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) {
    std::lock_guard<std::mutex> lock(mu_);
    if (session_ == 0)
        return TEE_ERROR_BAD_STATE;
    TEE_Param none[4] = {};
    if (!params)
        params = none;
    std::vector<uint8_t> request;
    TEE_Result res = kmd::encode_invoke(session_, cmd, types, params, &request);
    if (res != TEE_SUCCESS)
        return res;
    uint32_t capacity[4] = {};
    for (int i = 0; i < 4; ++i)
        if (kmd::is_memref(kmd::param_type(types, i)))
            capacity[i] = params[i].memref.size;
    TEE_Result result = TEE_SUCCESS;
    res = exchange_locked(request, kmd::kInvoke, &result);
    if (res != TEE_SUCCESS)
        return res;
    kmd::FrameReader r = fields();
    if (!kmd::decode_invoke_reply(r, types, params, capacity)) {
        disconnect_locked("kmd on " + socket_.string() + " sent a malformed reply");
        return TEE_ERROR_COMMUNICATION;
    }
    return result;
}

void SocketTransport::close() {
    std::lock_guard<std::mutex> lock(mu_);
    if (fd_ < 0)
        return;
    if (session_ != 0) {
        TEE_Result closed = TEE_SUCCESS;
        exchange_locked(kmd::FrameWriter(kmd::kCloseSession).u32(session_).done(), kmd::kCloseSession, &closed);
    }
    disconnect_locked("");
}

TEE_Result SocketTransport::notify_fid(uint32_t fid) {
    std::lock_guard<std::mutex> lock(mu_);
    TEE_Result notified = TEE_SUCCESS;
    TEE_Result res = exchange_locked(kmd::FrameWriter(kmd::kNotifyFid).u32(fid).done(), kmd::kNotifyFid, &notified);
    if (res != TEE_SUCCESS)
        return res;
    if (!fields().finished()) {
        disconnect_locked("kmd on " + socket_.string() + " sent a malformed reply");
        return TEE_ERROR_COMMUNICATION;
    }
    return notified;
}

} // namespace km
