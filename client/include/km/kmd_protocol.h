/*
 * kmd_protocol.h - the frames between a client and kmd, the daemon that
 * keeps one TEE alive for many client processes on a Unix stream socket.
 *
 * Framing. Every frame, either way, is a u32 body length followed by the
 * body; the body starts with a u8 kind. All integers are u32 little-endian,
 * unaligned. A body is at most kMaxFrame bytes and a memory reference at
 * most kMaxMemref; a client sends one request and reads its reply before
 * the next, and kmd answers every request of a connection in order.
 *
 * Requests (client to kmd):
 *
 *   kOpenSession   u32 version (kProtocolVersion)
 *   kCloseSession  u32 session
 *   kInvoke        u32 session, u32 command, u32 param types, then for each
 *                  of the four parameters, by its type nibble:
 *                    NONE                   nothing
 *                    VALUE_*                u32 a, u32 b
 *                    MEMREF_INPUT, _INOUT   u8 flags, u32 size, size bytes
 *                    MEMREF_OUTPUT          u8 flags, u32 capacity
 *                  flags bit 0 (kMemrefNull): the caller passed a NULL
 *                  buffer; no bytes follow and the TA gets NULL with the size.
 *   kNotifyFid     u32 fid: the fingerprint TA beside the Keymaster TA
 *                  reports that fingerprint fid matched.
 *
 * Replies (kmd to client): u8 kind, u32 TEE result, u32 return origin
 * (TEE_ORIGIN_*), then by kind:
 *
 *   kOpenSession | kReply   u32 session (0 unless the result is TEE_SUCCESS)
 *   kCloseSession | kReply  nothing
 *   kInvoke | kReply        for each parameter, by the request's type nibble:
 *                             VALUE_OUTPUT, _INOUT    u32 a, u32 b
 *                             MEMREF_OUTPUT, _INOUT   u32 size, u32 n, n bytes
 *                             others                  nothing
 *                           size is what the TA left in the reference: the
 *                           bytes written, or the size it needs with
 *                           TEE_ERROR_SHORT_BUFFER. n is size when that fits
 *                           the capacity and the buffer was not NULL, else 0.
 *   kNotifyFid | kReply     nothing
 *   kError                  nothing: kmd refused the request before it reached
 *                           the TEE (TEE_ERROR_BAD_FORMAT: malformed body,
 *                           unknown kind, trailing bytes; TEE_ERROR_EXCESS_DATA:
 *                           a body or memory reference above its cap, after
 *                           which kmd closes the connection; TEE_ERROR_BAD_STATE:
 *                           a session this connection did not open;
 *                           TEE_ERROR_BAD_PARAMETERS: an undefined type nibble;
 *                           TEE_ERROR_NOT_SUPPORTED: another protocol version;
 *                           TEE_ERROR_BUSY: too many sessions).
 *
 * A connection is one normal-world client. Sessions it opened are closed,
 * and operations it began are aborted, when it closes. There is nothing
 * else on the socket: no test control of the platform is reachable.
 */
#ifndef KM_KMD_PROTOCOL_H
#define KM_KMD_PROTOCOL_H

#include <cstddef>
#include <cstdint>
#include <vector>

#include "tee_api_defines.h"
#include "tee_api_types.h"

namespace km::kmd {

constexpr uint32_t kProtocolVersion = 1;

// The largest memory reference either way, and the largest body: four
// references at their cap with every fixed field of an invoke.
constexpr uint32_t kMaxMemref = 1024 * 1024;
constexpr uint32_t kMaxFrame = 4 * (kMaxMemref + 9) + 16;

// Sessions one connection may hold open at once.
constexpr size_t kMaxSessionsPerConnection = 16;

enum Kind : uint8_t {
    kOpenSession = 1,
    kCloseSession = 2,
    kInvoke = 3,
    kNotifyFid = 4,
    kReply = 0x80, // or-ed into the request's kind
    kError = 0xFF,
};

constexpr uint8_t kMemrefNull = 1;

// param_type - the type nibble of parameter i.
constexpr uint32_t param_type(uint32_t types, int i) {
    return (types >> (4 * i)) & 0xF;
}
constexpr bool is_value(uint32_t t) {
    return t == TEE_PARAM_TYPE_VALUE_INPUT || t == TEE_PARAM_TYPE_VALUE_OUTPUT || t == TEE_PARAM_TYPE_VALUE_INOUT;
}
constexpr bool is_memref(uint32_t t) {
    return t == TEE_PARAM_TYPE_MEMREF_INPUT || t == TEE_PARAM_TYPE_MEMREF_OUTPUT || t == TEE_PARAM_TYPE_MEMREF_INOUT;
}
// valid_types - a types word whose four nibbles are all defined, and nothing above them.
constexpr bool valid_types(uint32_t types) {
    if (types > 0xFFFF)
        return false;
    for (int i = 0; i < 4; ++i) {
        uint32_t t = param_type(types, i);
        if (t != TEE_PARAM_TYPE_NONE && !is_value(t) && !is_memref(t))
            return false;
    }
    return true;
}

// FrameWriter - builds one frame: the length is filled in by done().
class FrameWriter {
  public:
    explicit FrameWriter(uint8_t kind) : bytes_(4, 0) { bytes_.push_back(kind); }
    FrameWriter &u8(uint8_t v) {
        bytes_.push_back(v);
        return *this;
    }
    FrameWriter &u32(uint32_t v) {
        for (int i = 0; i < 4; ++i)
            bytes_.push_back(static_cast<uint8_t>(v >> (8 * i)));
        return *this;
    }
    FrameWriter &raw(const void *p, size_t n) {
        const uint8_t *b = static_cast<const uint8_t *>(p);
        bytes_.insert(bytes_.end(), b, b + n);
        return *this;
    }
    // done - the whole frame, length prefix included.
    std::vector<uint8_t> done() {
        uint32_t n = static_cast<uint32_t>(bytes_.size() - 4);
        for (int i = 0; i < 4; ++i)
            bytes_[i] = static_cast<uint8_t>(n >> (8 * i));
        return std::move(bytes_);
    }

  private:
    std::vector<uint8_t> bytes_;
};

// FrameReader - reads a body field by field; a read past the end fails and
// every later read fails too, so a caller checks ok() once at the end.
class FrameReader {
  public:
    FrameReader(const uint8_t *p, size_t n) : p_(p), left_(n) {}
    uint8_t u8() {
        const uint8_t *b = take(1);
        return b ? b[0] : 0;
    }
    uint32_t u32() {
        const uint8_t *b = take(4);
        return b ? uint32_t{b[0]} | uint32_t{b[1]} << 8 | uint32_t{b[2]} << 16 | uint32_t{b[3]} << 24 : 0;
    }
    // raw - n bytes in place, or null when fewer are left.
    const uint8_t *raw(size_t n) { return take(n); }
    bool ok() const { return ok_; }
    // finished - everything read, nothing left over.
    bool finished() const { return ok_ && left_ == 0; }

  private:
    const uint8_t *take(size_t n) {
        if (!ok_ || n > left_) {
            ok_ = false;
            return nullptr;
        }
        const uint8_t *b = p_;
        p_ += n;
        left_ -= n;
        return b;
    }
    const uint8_t *p_;
    size_t left_;
    bool ok_ = true;
};

// frame_length - the body length announced by a frame's first four bytes.
inline uint32_t frame_length(const uint8_t *p) {
    return uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
}

// InvokeCall - an invoke as kmd received it: the parameters point into
// buffers of its own, sized to the caller's capacities.
struct InvokeCall {
    uint32_t session = 0;
    uint32_t command = 0;
    uint32_t types = 0;
    TEE_Param params[4] = {};
    uint32_t capacity[4] = {}; // what each memory reference came with
    bool null[4] = {};
    std::vector<uint8_t> buffers[4];
};

// encode_invoke - the client's request. TEE_ERROR_BAD_PARAMETERS for an
// undefined type nibble, TEE_ERROR_EXCESS_DATA for a memory reference above
// kMaxMemref; nothing is sent then.
TEE_Result encode_invoke(uint32_t session, uint32_t command, uint32_t types, const TEE_Param params[4],
                         std::vector<uint8_t> *frame);

// decode_invoke - kmd's side of the same, from the body after the kind
// byte. TEE_SUCCESS, or the result of the kError reply to send.
TEE_Result decode_invoke(FrameReader &body, InvokeCall *call);

// encode_invoke_reply - what the TA left in call's parameters, with its result.
std::vector<uint8_t> encode_invoke_reply(TEE_Result result, uint32_t origin, const InvokeCall &call);

// decode_invoke_reply - writes a reply's values and memory-reference
// outputs into the caller's parameters (types and capacities as sent),
// from the body after the kind, result and origin. False, with the
// parameters possibly partly written, when the reply does not match.
bool decode_invoke_reply(FrameReader &body, uint32_t types, TEE_Param params[4], const uint32_t capacity[4]);

} // namespace km::kmd

#endif
