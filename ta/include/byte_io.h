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
inline uint64_t get_u64le(const uint8_t *p) {
    return uint64_t{get_u32le(p)} | uint64_t{get_u32le(p + 4)} << 32;
}
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

// Big-endian fields: cryptographic integers and the auth token's type and time.
inline uint32_t get_u32be(const uint8_t *p) {
    return uint32_t{p[0]} << 24 | uint32_t{p[1]} << 16 | uint32_t{p[2]} << 8 | uint32_t{p[3]};
}
inline uint64_t get_u64be(const uint8_t *p) {
    return uint64_t{get_u32be(p)} << 32 | get_u32be(p + 4);
}
inline void put_u64be(uint8_t *p, uint64_t v) {
    for (int i = 0; i < 8; ++i)
        p[i] = static_cast<uint8_t>(v >> (8 * (7 - i)));
}

/*
 * bytes_equal_ct - whether a and b hold the same n bytes, in a time that
 * depends on n only: secrets compared with it leak nothing through timing.
 */
inline bool bytes_equal_ct(const uint8_t *a, const uint8_t *b, uint32_t n) {
    uint8_t diff = 0;
    for (uint32_t i = 0; i < n; ++i)
        diff |= static_cast<uint8_t>(a[i] ^ b[i]);
    return diff == 0;
}

/*
 * right_align - moves the len bytes at the start of buf (capacity width) to
 * its end and zero-fills the front: big-endian results that came back
 * without their leading zero bytes regain their full width.
 */
inline void right_align(uint8_t *buf, uint32_t len, uint32_t width) {
    if (len >= width)
        return;
    std::memmove(buf + width - len, buf, len);
    std::memset(buf, 0, width - len);
}

/*
 * byte_cursor - a position in a buffer the cursor does not own and the
 * bytes left after it. Every step is checked against what is left;
 * running out logs "Too short input" in the caller's name.
 */
template <typename Byte> class byte_cursor {
  public:
    uint32_t remaining() const { return left_; }
    Byte *pos() const { return p_; }

  protected:
    byte_cursor(Byte *data, uint32_t len) : p_(data), left_(data ? len : 0) {}
    bool advance(uint32_t n, Byte **at, const char *func, int line) {
        if (n > left_) {
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Too short input");
            return false;
        }
        *at = p_;
        p_ += n;
        left_ -= n;
        return true;
    }
    Byte *p_;
    uint32_t left_;
};

/* byte_reader - reads forward through a buffer it does not own. */
class byte_reader : public byte_cursor<const uint8_t> {
  public:
    byte_reader(const void *data, uint32_t len) : byte_cursor(static_cast<const uint8_t *>(data), len) {}

    /* read_u32, read_u64 - little-endian integers; false (logged) when too few bytes remain. */
    bool read_u32(uint32_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        return read_int<uint32_t, get_u32le>(v, func, line);
    }
    bool read_u64(uint64_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        return read_int<uint64_t, get_u64le>(v, func, line);
    }
    /* read_u32be, read_u64be - big-endian integers. */
    bool read_u32be(uint32_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        return read_int<uint32_t, get_u32be>(v, func, line);
    }
    bool read_u64be(uint64_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        return read_int<uint64_t, get_u64be>(v, func, line);
    }
    /* read_u8 - one byte. */
    bool read_u8(uint8_t *v, const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
        return read_int<uint8_t, get_u8>(v, func, line);
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

  private:
    static uint8_t get_u8(const uint8_t *p) { return *p; }
    template <typename T, T (*Decode)(const uint8_t *)> bool read_int(T *v, const char *func, int line) {
        const uint8_t *at = nullptr;
        if (!take(sizeof(T), &at, func, line))
            return false;
        *v = Decode(at);
        return true;
    }
    bool take(uint32_t n, const uint8_t **out, const char *func, int line) { return advance(n, out, func, line); }
};

/* byte_writer - writes forward into a buffer it does not own, never past its capacity. */
class byte_writer : public byte_cursor<uint8_t> {
  public:
    byte_writer(void *data, uint32_t cap) : byte_cursor(static_cast<uint8_t *>(data), cap), start_(p_) {}

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
        return advance(n, at, func, line);
    }
    uint32_t written() const { return static_cast<uint32_t>(p_ - start_); }

  private:
    uint8_t *start_;
};

#endif
