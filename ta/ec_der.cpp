/*
 * ec_der.cpp - the DER codec of ECDSA signatures. The decoder re-encodes
 * what it read and compares, so non-minimal integers and lengths, missing
 * sign bytes and trailing bytes are all refused without a rule of their own.
 */
#include "ec_der.h"

#include "ta_heap.h"
#include "ta_log.h"

namespace {

constexpr uint8_t kSequence = 0x30;
constexpr uint8_t kInteger = 0x02;

// The fewest bytes that hold len.
uint32_t length_bytes(uint32_t len) {
    if (len <= 0xFF)
        return 1;
    if (len <= 0xFFFF)
        return 2;
    if (len <= 0xFFFFFF)
        return 3;
    return 4;
}

// An unsigned integer as DER wants it: without leading zeros, and whether
// it needs a 0x00 in front to stay positive.
struct der_integer {
    const uint8_t *p;
    uint32_t len;
    bool sign_byte;
    uint32_t content() const { return len + (sign_byte ? 1 : 0); }
};

der_integer minimal(const uint8_t *p, uint32_t len) {
    while (len && *p == 0) {
        ++p;
        --len;
    }
    return {p, len, len && *p >= 0x80};
}

bool write_integer(byte_writer *w, const der_integer &v) {
    const uint8_t tag = kInteger;
    const uint8_t zero = 0;
    return w->write_bytes(&tag, 1, "der_encode_ec_signature") && encode_length(w, v.content()) &&
           (!v.sign_byte || w->write_bytes(&zero, 1, "der_encode_ec_signature")) &&
           w->write_bytes(v.p, v.len, "der_encode_ec_signature");
}

// A DER length field: short form, or 0x80 | n and n big-endian bytes (n up to 4).
bool decode_length(byte_reader *r, uint32_t *len) {
    uint8_t first = 0;
    if (!r->read_u8(&first, "der_decode_ec_signature"))
        return false;
    if (first < 0x80) {
        *len = first;
        return true;
    }
    const uint32_t n = first & 0x7Fu;
    const uint8_t *bytes = nullptr;
    if (n > 4 || n > r->remaining() || !r->read_bytes(n, &bytes, "der_decode_ec_signature"))
        return false;
    uint32_t v = 0;
    for (uint32_t i = 0; i < n; ++i)
        v = v << 8 | bytes[i];
    *len = v;
    return true;
}

// One INTEGER into its buffer, right-aligned: tag, length, at most one
// leading zero skipped; is_r names it in the log lines.
bool decode_integer(byte_reader *r, uint8_t *out, uint32_t out_size, bool is_r) {
    uint8_t tag = 0;
    if (!r->read_u8(&tag, "der_decode_ec_signature"))
        return false;
    if (tag != kInteger) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "der_decode_ec_signature", __LINE__, "Wrong tag, expect 0x02, got 0x%02x", tag);
        return false;
    }
    uint32_t len = 0;
    if (!decode_length(r, &len)) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "der_decode_ec_signature", __LINE__, "Decode length failed");
        return false;
    }
    if (len > r->remaining()) {
        KM_TRACE_AT(TEE_TRACE_ERROR, "der_decode_ec_signature", __LINE__,
                    "Wrong length of integer, %dB available, got %dB", static_cast<int>(r->remaining()),
                    static_cast<int>(len));
        return false;
    }
    const uint8_t *value = nullptr;
    if (!r->read_bytes(len, &value, "der_decode_ec_signature"))
        return false;
    if (len && value[0] == 0) {
        ++value;
        --len;
    }
    if (len > out_size) {
        if (is_r)
            KM_TRACE_AT(TEE_TRACE_ERROR, "der_decode_ec_signature", __LINE__,
                        "Wrong length of R, expect max %dB, got %dB", static_cast<int>(out_size),
                        static_cast<int>(len));
        else
            KM_TRACE_AT(TEE_TRACE_ERROR, "der_decode_ec_signature", __LINE__,
                        "Wrong length of S, expect max %dB, got %dB", static_cast<int>(out_size),
                        static_cast<int>(len));
        return false;
    }
    TEE_MemFill(out, 0, out_size - len);
    if (len)
        TEE_MemMove(out + out_size - len, value, len);
    return true;
}

} // namespace

uint32_t der_length_size(uint32_t len) {
    return len <= 127 ? 1 : 1 + length_bytes(len);
}

bool encode_length(byte_writer *w, uint32_t len) {
    uint8_t field[5] = {};
    uint32_t n = 0;
    if (len <= 127) {
        field[0] = static_cast<uint8_t>(len);
        return w->write_bytes(field, 1, "encode_length");
    }
    n = length_bytes(len);
    if (n < 1 || n > 4) {
        KM_ERR("There must be some thing wrong");
        return false;
    }
    field[0] = static_cast<uint8_t>(0x80 | n);
    for (uint32_t i = 0; i < n; ++i)
        field[1 + i] = static_cast<uint8_t>(len >> (8 * (n - 1 - i)));
    return w->write_bytes(field, 1 + n, "encode_length");
}

uint8_t *der_encode_ec_signature(const uint8_t *r, uint32_t r_len, const uint8_t *s, uint32_t s_len,
                                 uint32_t *out_len) {
    const der_integer rv = minimal(r, r_len);
    const der_integer sv = minimal(s, s_len);
    const uint64_t lr = rv.content();
    const uint64_t ls = sv.content();
    const uint64_t c64 =
        2 + der_length_size(static_cast<uint32_t>(lr)) + lr + der_length_size(static_cast<uint32_t>(ls)) + ls;
    // Signature halves are a few dozen bytes; anything near 4 GiB is no signature.
    if (lr > UINT32_MAX / 4 || ls > UINT32_MAX / 4 || c64 > UINT32_MAX / 2) {
        KM_ERR("Out of memory");
        return nullptr;
    }
    const uint32_t c = static_cast<uint32_t>(c64);
    const uint32_t total = 1 + der_length_size(c) + c;
    heap_buf out;
    if (!out.alloc(total)) {
        KM_ERR("Out of memory");
        return nullptr;
    }
    byte_writer w(out.get(), total);
    const uint8_t tag = kSequence;
    if (!w.write_bytes(&tag, 1) || !encode_length(&w, c) || !write_integer(&w, rv) || !write_integer(&w, sv) ||
        w.written() != total) {
        KM_ERR("Unfilled buffer, size calculation error");
        return nullptr;
    }
    if (out_len)
        *out_len = total;
    return out.release();
}

TEE_Result der_decode_ec_signature(const uint8_t *der, uint32_t der_len, uint8_t *r, uint32_t r_size, uint8_t *s,
                                   uint32_t s_size) {
    if (!der || der_len <= 1) {
        KM_ERR("Wrong der length\n");
        return TEE_ERROR_GENERIC;
    }
    byte_reader in(der, der_len);
    uint8_t tag = 0;
    if (!in.read_u8(&tag))
        return TEE_ERROR_GENERIC;
    if (tag != kSequence) {
        KM_ERR("Wrong tag, expect 0x30, got 0x%02x", tag);
        return TEE_ERROR_GENERIC;
    }
    uint32_t len = 0;
    if (!decode_length(&in, &len)) {
        KM_ERR("Decode length failed");
        return TEE_ERROR_GENERIC;
    }
    if (len != in.remaining()) {
        KM_ERR("Wrong length of sequence, expect %dB, got %dB", static_cast<int>(in.remaining()),
               static_cast<int>(len));
        return TEE_ERROR_GENERIC;
    }
    if (!decode_integer(&in, r, r_size, true) || !decode_integer(&in, s, s_size, false))
        return TEE_ERROR_GENERIC;
    uint32_t again_len = 0;
    heap_buf again;
    again.adopt(der_encode_ec_signature(r, r_size, s, s_size, &again_len), again_len);
    if (!again) {
        KM_ERR("Out of memory");
        return TEE_ERROR_OUT_OF_MEMORY;
    }
    if (again_len != der_len) {
        KM_ERR("Encoding size mismatch");
        return TEE_ERROR_GENERIC;
    }
    if (TEE_MemCompare(again.get(), der, der_len) != 0) {
        KM_ERR("Encoding mismatch");
        return TEE_ERROR_GENERIC;
    }
    return TEE_SUCCESS;
}
