/*
 * ta_calls.h - driving the Keymaster TA as a normal-world caller does,
 * for GoogleTest suites and for code outside them (the fuzz harnesses):
 * a command's parameters as real TEE_Param arrays, its two result
 * channels, the key reference of the characteristics and export commands,
 * and auth tokens MACed with the platform's boot seed. No GoogleTest here.
 */
#ifndef TA_CALLS_H
#define TA_CALLS_H

#include <cstdint>
#include <cstdio>
#include <ostream>
#include <string>
#include <vector>

#include <openssl/evp.h>
#include <openssl/hmac.h>

#include "km/param_set.h"
#include "tee_host.h"

using Bytes = std::vector<uint8_t>;

// A command's parameters as the normal world would pass them.
struct Params {
    uint32_t types = 0;
    TEE_Param p[4] = {};

    static Params value(uint32_t a = 0, uint32_t b = 0) {
        Params r;
        r.types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, 0, 0, 0);
        r.p[0].value.a = a;
        r.p[0].value.b = b;
        return r;
    }
    // value in params[0], optional input in params[1], output capacity in params[2].
    static Params io(uint32_t a, uint32_t b, Bytes *in, Bytes *out) {
        Params r = value(a, b);
        uint32_t t1 = TEE_PARAM_TYPE_NONE;
        uint32_t t2 = TEE_PARAM_TYPE_NONE;
        if (in) {
            t1 = TEE_PARAM_TYPE_MEMREF_INPUT;
            r.p[1].memref.buffer = in->data();
            r.p[1].memref.size = static_cast<uint32_t>(in->size());
        }
        if (out) {
            t2 = TEE_PARAM_TYPE_MEMREF_OUTPUT;
            r.p[2].memref.buffer = out->data();
            r.p[2].memref.size = static_cast<uint32_t>(out->size());
        }
        r.types = TEE_PARAM_TYPES(TEE_PARAM_TYPE_VALUE_INOUT, t1, t2, 0);
        return r;
    }
};

// A command's two result channels: the TEE result and the Keymaster error in a.
struct Outcome {
    TEE_Result res;
    int32_t error;
    bool ok() const { return res == TEE_SUCCESS && error == 0; }
    bool operator==(const Outcome &o) const { return res == o.res && error == o.error; }
};
inline std::ostream &operator<<(std::ostream &os, const Outcome &o) {
    char buf[48];
    std::snprintf(buf, sizeof buf, "{0x%08x, %d}", static_cast<unsigned>(o.res), static_cast<int>(o.error));
    return os << buf;
}

// to_hex - bytes as lower-case hex, for messages.
inline std::string to_hex(const uint8_t *p, size_t n) {
    static const char digits[] = "0123456789abcdef";
    std::string s;
    for (size_t i = 0; i < n; ++i) {
        s += digits[p[i] >> 4];
        s += digits[p[i] & 15];
    }
    return s;
}
inline std::string to_hex(const Bytes &b) {
    return to_hex(b.data(), b.size());
}

// key_reference - the three-field key reference of the characteristics and export commands.
inline Bytes key_reference(const Bytes &blob, const Bytes &app_id = {}, const Bytes &app_data = {}) {
    Bytes out;
    km::put_lv(out, blob);
    km::put_lv(out, app_id);
    km::put_lv(out, app_data);
    return out;
}

// The fields of an auth token, host byte order.
struct AuthTokenFields {
    uint64_t challenge = 0;
    uint64_t user_id = 0;
    uint64_t authenticator_id = 0;
    uint32_t auth_type = 0;
    uint64_t timestamp_ms = 0;
    uint8_t version = 0;
};

// mint_auth_token - the 69-byte token an authenticator sharing the boot
// seed would issue; empty when the MAC cannot be computed.
inline Bytes mint_auth_token(const Bytes &boot_seed, const AuthTokenFields &f) {
    Bytes t(69, 0);
    t[0] = f.version;
    for (int i = 0; i < 8; ++i) {
        t[1 + i] = static_cast<uint8_t>(f.challenge >> (8 * i));
        t[9 + i] = static_cast<uint8_t>(f.user_id >> (8 * i));
        t[17 + i] = static_cast<uint8_t>(f.authenticator_id >> (8 * i));
        t[29 + i] = static_cast<uint8_t>(f.timestamp_ms >> (8 * (7 - i)));
    }
    for (int i = 0; i < 4; ++i)
        t[25 + i] = static_cast<uint8_t>(f.auth_type >> (8 * (3 - i)));
    unsigned int len = 0;
    if (!HMAC(EVP_sha256(), boot_seed.data(), static_cast<int>(boot_seed.size()), t.data(), 37, t.data() + 37, &len) ||
        len != 32)
        return {};
    return t;
}

#endif
