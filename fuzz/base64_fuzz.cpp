/*
 * base64_fuzz.cpp - base64 and the PEM wrapping. The encoder writes what
 * OpenSSL's block encoder writes and the decoder reads it back; the decoder
 * reads any text as the model does (characters outside the alphabet
 * skipped, a last group of two or three characters giving one or two
 * bytes); the PEM text is header, one line of base64, footer and NUL, in
 * exactly its length and refused when one byte short, also when the
 * destination is the buffer holding the DER.
 */
#include <algorithm>
#include <cstring>
#include <string>

#include <openssl/evp.h>

#include "base64.h"
#include "fuzz_support.h"
#include "ta_heap.h"

namespace {

std::string openssl_base64(const Bytes &b) {
    std::string out(4 * ((b.size() + 2) / 3) + 1, '\0');
    const int n = EVP_EncodeBlock(reinterpret_cast<unsigned char *>(out.data()), b.data(), static_cast<int>(b.size()));
    out.resize(static_cast<size_t>(n));
    return out;
}

Bytes model_decode(const std::string &text) {
    static const std::string alphabet = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    Bytes out;
    uint32_t acc = 0;
    int have = 0;
    for (char c : text) {
        const size_t v = alphabet.find(c);
        if (c == '\0' || v == std::string::npos)
            continue;
        acc = acc << 6 | static_cast<uint32_t>(v);
        if (++have == 4) {
            out.push_back(static_cast<uint8_t>(acc >> 16));
            out.push_back(static_cast<uint8_t>(acc >> 8));
            out.push_back(static_cast<uint8_t>(acc));
            acc = 0;
            have = 0;
        }
    }
    if (have == 2) {
        out.push_back(static_cast<uint8_t>(acc >> 4));
    } else if (have == 3) {
        out.push_back(static_cast<uint8_t>(acc >> 10));
        out.push_back(static_cast<uint8_t>(acc >> 2));
    }
    return out;
}

Bytes decoded(const char *text) {
    uint8_t *out = nullptr;
    const uint32_t n = base64_decode(text, &out);
    FUZZ_CHECK((n == 0) == (out == nullptr), "base64_decode returned %u bytes and %p", n, static_cast<void *>(out));
    Bytes b(out, out + n);
    ta_free(out);
    return b;
}

void check_encode(const Bytes &data) {
    char *text = base64_encode(data.empty() ? reinterpret_cast<const uint8_t *>("") : data.data(),
                               static_cast<uint32_t>(data.size()));
    FUZZ_CHECK(text != nullptr, "base64_encode failed on %zu bytes", data.size());
    const std::string mine(text);
    FUZZ_CHECK(mine == openssl_base64(data), "base64 of %s: %s", to_hex(data).c_str(), text);
    FUZZ_CHECK(decoded(text) == data, "base64 does not decode back: %s", text);
    ta_free(text);
}

void check_pem(const Bytes &der, uint32_t slack, bool in_place) {
    const std::string expected =
        "-----BEGIN PUBLIC KEY-----\n" + openssl_base64(der) + "\n-----END PUBLIC KEY-----" + std::string(1, '\0');
    const uint32_t need = static_cast<uint32_t>(expected.size());
    for (uint32_t cap : {need - 1, need + slack}) {
        Bytes dest(std::max<size_t>(cap, der.size()) + 1, 0xEE);
        const uint8_t *src = der.data();
        if (in_place && !der.empty()) {
            std::memcpy(dest.data(), der.data(), der.size());
            src = dest.data();
        }
        uint32_t out_len = 0xDEAD;
        const TEE_Result res = public_key_to_pem(der.empty() ? reinterpret_cast<const uint8_t *>("") : src,
                                                 static_cast<uint32_t>(der.size()), dest.data(), cap, &out_len);
        if (cap < need) {
            FUZZ_CHECK(res == TEE_ERROR_SHORT_BUFFER && out_len == 0xDEAD, "PEM into %u of %u bytes: 0x%08x", cap, need,
                       res);
            if (!in_place)
                for (uint8_t b : dest)
                    FUZZ_CHECK(b == 0xEE, "a refused PEM wrote");
            continue;
        }
        FUZZ_CHECK(res == TEE_SUCCESS && out_len == need, "PEM of %zu bytes: 0x%08x, %u", der.size(), res, out_len);
        FUZZ_CHECK(std::memcmp(dest.data(), expected.data(), need) == 0, "PEM text differs");
        FUZZ_CHECK(dest[dest.size() - 1] == 0xEE, "PEM wrote past its capacity");
    }
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    HeapScope heap;
    FuzzInput in(data, size);
    const uint8_t mode = in.u8();
    const uint32_t slack = in.below(8);
    Bytes rest = in.rest();
    switch (mode % 3) {
    case 0:
        check_encode(rest);
        break;
    case 1: {
        const std::string text(rest.begin(), rest.end());
        FUZZ_CHECK(decoded(text.c_str()) == model_decode(text.substr(0, text.find('\0'))), "base64_decode of %s",
                   to_hex(rest).c_str());
        break;
    }
    default:
        check_pem(rest, slack, mode & 4);
        break;
    }
    return 0;
}
