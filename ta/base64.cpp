/*
 * base64.cpp - base64 and the PEM text of public keys.
 */
#include "base64.h"

#include <cstring>

#include "byte_io.h"
#include "ta_heap.h"
#include "ta_log.h"

namespace {

const char kAlphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";

// Six-bit values of '+' (43) to 'z' (122); 0xFF marks characters outside the alphabet.
constexpr uint8_t kInvalid = 0xFF;
constexpr uint8_t kDecode[80] = {
    62,       kInvalid, kInvalid, kInvalid, 63, 52,       53,       54,       55,       56,       // '+' .. '8'
    57,       58,       59,       60,       61, kInvalid, kInvalid, kInvalid, kInvalid, kInvalid, // '9' .. '?'
    kInvalid, kInvalid, 0,        1,        2,  3,        4,        5,        6,        7,        // '@'(x2) A..H
    8,        9,        10,       11,       12, 13,       14,       15,       16,       17,       // I .. R
    18,       19,       20,       21,       22, 23,       24,       25,       kInvalid, kInvalid, // S .. Z [ '\'
    kInvalid, kInvalid, kInvalid, kInvalid, 26, 27,       28,       29,       30,       31,       // ] ^ _ ` a .. f
    32,       33,       34,       35,       36, 37,       38,       39,       40,       41,       // g .. p
    42,       43,       44,       45,       46, 47,       48,       49,       50,       51,       // q .. z
};

uint8_t decode_char(char c) {
    auto u = static_cast<uint8_t>(c);
    if (u < '+' || u > 'z')
        return kInvalid;
    return kDecode[u - '+'];
}

const char kPemHeader[] = "-----BEGIN PUBLIC KEY-----\n";
const char kPemFooter[] = "\n-----END PUBLIC KEY-----";

} // namespace

char *base64_encode(const uint8_t *data, uint32_t length) {
    if (!data)
        return nullptr;
    uint32_t groups = length / 3 + (length % 3 ? 1 : 0);
    if (groups > (UINT32_MAX - 1) / 4)
        return nullptr;
    auto *out = static_cast<char *>(ta_malloc(groups * 4 + 1));
    if (!out)
        return nullptr;
    char *p = out;
    for (uint32_t i = 0; i < length; i += 3) {
        uint32_t left = length - i;
        uint32_t b0 = data[i];
        uint32_t b1 = left > 1 ? data[i + 1] : 0;
        uint32_t b2 = left > 2 ? data[i + 2] : 0;
        uint32_t triple = b0 << 16 | b1 << 8 | b2;
        *p++ = kAlphabet[(triple >> 18) & 63];
        *p++ = kAlphabet[(triple >> 12) & 63];
        *p++ = left > 1 ? kAlphabet[(triple >> 6) & 63] : '=';
        *p++ = left > 2 ? kAlphabet[triple & 63] : '=';
    }
    *p = '\0';
    return out;
}

uint32_t base64_decode(const char *text, uint8_t **out) {
    if (!out)
        return 0;
    *out = nullptr;
    if (!text)
        return 0;
    size_t n = std::strlen(text);
    if (n > UINT32_MAX / 3)
        return 0;
    uint32_t cap = static_cast<uint32_t>(3 * n / 4 + (3 * n) % 4);
    auto *buf = static_cast<uint8_t *>(ta_malloc(cap));
    if (!buf)
        return 0;
    uint32_t written = 0;
    uint32_t acc = 0;
    uint32_t have = 0;
    for (size_t i = 0; i < n; ++i) {
        uint8_t v = decode_char(text[i]);
        if (v == kInvalid)
            continue;
        acc = acc << 6 | v;
        if (++have == 4) {
            buf[written++] = static_cast<uint8_t>(acc >> 16);
            buf[written++] = static_cast<uint8_t>(acc >> 8);
            buf[written++] = static_cast<uint8_t>(acc);
            acc = 0;
            have = 0;
        }
    }
    if (have == 2) {
        buf[written++] = static_cast<uint8_t>(acc >> 4);
    } else if (have == 3) {
        buf[written++] = static_cast<uint8_t>(acc >> 10);
        buf[written++] = static_cast<uint8_t>(acc >> 2);
    }
    if (written == 0) {
        ta_free(buf);
        return 0;
    }
    *out = buf;
    return written;
}

TEE_Result public_key_to_pem(const uint8_t *der, uint32_t der_len, uint8_t *dest, uint32_t capacity,
                             uint32_t *out_len) {
    char *b64 = base64_encode(der, der_len);
    if (!b64)
        return TEE_ERROR_OUT_OF_MEMORY;
    scope_exit free_b64([&] { ta_free(b64); });
    uint32_t b64_len = static_cast<uint32_t>(std::strlen(b64));
    constexpr uint32_t kFixed = sizeof kPemHeader - 1 + sizeof kPemFooter - 1 + 1;
    if (b64_len > UINT32_MAX - kFixed)
        return TEE_ERROR_SHORT_BUFFER;
    uint32_t total = kFixed + b64_len;
    if (!dest || total > capacity)
        return TEE_ERROR_SHORT_BUFFER;
    // The DER may live in dest: it is fully encoded in b64 by now.
    byte_writer w(dest, capacity);
    if (!w.write_bytes(kPemHeader, sizeof kPemHeader - 1) || !w.write_bytes(b64, b64_len) ||
        !w.write_bytes(kPemFooter, sizeof kPemFooter - 1) || !w.write_bytes("", 1))
        return TEE_ERROR_SHORT_BUFFER;
    *out_len = total;
    return TEE_SUCCESS;
}
