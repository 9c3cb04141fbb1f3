/*
 * byte_io.h - the one bounded reader and writer for the TA's
 * length-prefixed, little-endian formats. Every read and write is a single
 * checked call; running out logs "Too short input" in the caller's name.
 */
#ifndef BYTE_IO_H
#define BYTE_IO_H

#include <cstdint>
#include <cstring>

#include "ta_log.h"

inline uint32_t get_u32le(const uint8_t *p) {
    return uint32_t{p[0]} | uint32_t{p[1]} << 8 | uint32_t{p[2]} << 16 | uint32_t{p[3]} << 24;
}
inline uint64_t get_u64le(const uint8_t *p) { return uint64_t{get_u32le(p)} | uint64_t{get_u32le(p + 4)} << 32; }
inline void put_u32le(uint8_t *p, uint32_t v) {
    p[0] = static_cast<uint8_t>(v);
    p[1] = static_cast<uint8_t>(v >> 8);
    p[2] = static_cast<uint8_t>(v >> 16);
    p[3] = static_cast<uint8_t>(v >> 24);
}
inline void put_u64le(uint8_t *p, uint64_t v) {
    put_u32le(p, static_cast<uint32_t>(v));
    put_u32le(p + 4, static_cast<uint32_t>(v >> 32));
}

/* byte_reader - reads forward through a buffer it does not own. */
class byte_reader {
public:
    byte_reader(const void *data, uint32_t len) : p_(static_cast<const uint8_t *>(data)), left_(data ? len : 0) {}

    /* read_u32 - a little-endian u32; false (logged) when fewer than 4 bytes remain. */
    bool read_u32(uint32_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        const uint8_t *at = nullptr;
        if (!take(4, &at, func, line))
            return false;
        *v = get_u32le(at);
        return true;
    }
    /* read_bytes - n bytes in place; *out points into the reader's buffer. */
    bool read_bytes(uint32_t n, const uint8_t **out, const char *func = __builtin_FUNCTION(),
                    int line = __builtin_LINE()) {
        return take(n, out, func, line);
    }
    /* read_lv - a u32 length followed by that many bytes, in place. */
    bool read_lv(const uint8_t **data, uint32_t *len, const char *func = __builtin_FUNCTION(),
                 int line = __builtin_LINE()) {
        uint32_t n = 0;
        if (!read_u32(&n, func, line) || !take(n, data, func, line))
            return false;
        *len = n;
        return true;
    }
    /* copy - n bytes into dst. */
    bool copy(void *dst, uint32_t n, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        const uint8_t *at = nullptr;
        if (!take(n, &at, func, line))
            return false;
        if (n)
            std::memcpy(dst, at, n);
        return true;
    }
    uint32_t remaining() const { return left_; }
    const uint8_t *pos() const { return p_; }

private:
    bool take(uint32_t n, const uint8_t **out, const char *func, int line) {
        if (n > left_) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Too short input");
            return false;
        }
        *out = p_;
        p_ += n;
        left_ -= n;
        return true;
    }
    const uint8_t *p_;
    uint32_t left_;
};

/* byte_writer - writes forward into a buffer it does not own, never past its capacity. */
class byte_writer {
public:
    byte_writer(void *data, uint32_t cap) : start_(static_cast<uint8_t *>(data)), p_(start_), left_(data ? cap : 0) {}

    bool write_u32(uint32_t v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        uint8_t *at = nullptr;
        if (!reserve(4, &at, func, line))
            return false;
        put_u32le(at, v);
        return true;
    }
    bool write_bytes(const void *src, uint32_t n, const char *func = __builtin_FUNCTION(),
                     int line = __builtin_LINE()) {
        uint8_t *at = nullptr;
        if (!reserve(n, &at, func, line))
            return false;
        if (n)
            std::memcpy(at, src, n);
        return true;
    }
    /* reserve - claims n bytes to be filled by the caller through *at. */
    bool reserve(uint32_t n, uint8_t **at, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        if (n > left_) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Too short input");
            return false;
        }
        *at = p_;
        p_ += n;
        left_ -= n;
        return true;
    }
    uint32_t written() const { return static_cast<uint32_t>(p_ - start_); }
    uint32_t remaining() const { return left_; }
    uint8_t *pos() const { return p_; }

private:
    uint8_t *start_;
    uint8_t *p_;
    uint32_t left_;
};

#endif
