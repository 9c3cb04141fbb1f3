/*
 * socket_transport.h - a transport to the Keymaster TA that kmd hosts,
 * over kmd's Unix stream socket (the frames of kmd_protocol.h).
 */
#ifndef KM_SOCKET_TRANSPORT_H
#define KM_SOCKET_TRANSPORT_H

#include <cstdint>
#include <filesystem>
#include <mutex>
#include <string>
#include <vector>

#include "km/kmd_protocol.h"
#include "km/transport.h"

namespace km {

class SocketTransport final : public Transport {
  public:
    // SocketTransport - talks to the kmd listening on socket; connects on
    // the first call that needs it.
    explicit SocketTransport(std::filesystem::path socket);
    // ~SocketTransport - closes the session and the connection; kmd then
    // aborts every operation begun through it.
    ~SocketTransport() override;
    SocketTransport(const SocketTransport &) = delete;
    SocketTransport &operator=(const SocketTransport &) = delete;

    // open - connects and opens a session. TEE_ERROR_COMMUNICATION when kmd
    // cannot be reached or the connection breaks (error() says why).
    TEE_Result open() override;
    // invoke - as the embedded TEE: outputs written into the caller's
    // memory references, their sizes set. A memory reference above
    // kmd::kMaxMemref is TEE_ERROR_EXCESS_DATA before anything is sent.
    TEE_Result invoke(uint32_t cmd, uint32_t types, TEE_Param params[4]) override;
    // close - closes the session and the connection.
    void close() override;
    // notify_fid - kmd has its fingerprint TA send the notification.
    TEE_Result notify_fid(uint32_t fid) override;

    // error - what went wrong with the connection last, as a phrase
    // ("cannot connect to PATH: No such file or directory"); empty when nothing did.
    std::string error() const;

  private:
    bool connect_locked();
    void disconnect_locked(const std::string &why);
    // One request and its reply, kept in reply_.
    TEE_Result exchange_locked(const std::vector<uint8_t> &request, uint8_t kind, TEE_Result *result);
    // fields - a reader over the last reply's own fields.
    kmd::FrameReader fields() const;

    mutable std::mutex mu_; // one exchange at a time on the connection
    std::filesystem::path socket_;
    int fd_ = -1;
    uint32_t session_ = 0; // 0: none open
    std::vector<uint8_t> reply_;
    std::string error_;
};

} // namespace km

#endif
