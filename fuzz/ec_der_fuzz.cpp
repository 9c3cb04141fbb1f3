/*
 * ec_der_fuzz.cpp - the DER codec of ECDSA signatures against OpenSSL's.
 * The decoder accepts exactly the canonical DER of two positive integers
 * that fit their buffers (what OpenSSL reads and writes back byte for
 * byte), and fills r and s with their values; the encoder writes what
 * OpenSSL reads as the same two values, and the decoder reads it back.
 * A zero half is the exception: the TA spells it 02 00 (an INTEGER with
 * no content), which OpenSSL does not read, and no signature has one.
 */
#include <cstring>

#include <openssl/bn.h>
#include <openssl/ecdsa.h>

#include "ec_der.h"
#include "fuzz_support.h"
#include "ta_heap.h"

namespace {

struct SigFree {
    void operator()(ECDSA_SIG *s) const { ECDSA_SIG_free(s); }
};
using Sig = std::unique_ptr<ECDSA_SIG, SigFree>;

Sig openssl_decode(const Bytes &der) {
    const unsigned char *p = der.data();
    Sig sig(d2i_ECDSA_SIG(nullptr, &p, static_cast<long>(der.size())));
    if (sig && p != der.data() + der.size())
        sig.reset(); // bytes after the signature
    return sig;
}

Bytes openssl_encode(const ECDSA_SIG *sig) {
    unsigned char *der = nullptr;
    const int n = i2d_ECDSA_SIG(sig, &der);
    Bytes out;
    if (n > 0)
        out.assign(der, der + n);
    OPENSSL_free(der);
    return out;
}

// Whether bn, non-negative, is the big-endian number in buf.
bool same_value(const BIGNUM *bn, const Bytes &buf) {
    if (BN_is_negative(bn))
        return false;
    Bytes mine(buf.size(), 0);
    return BN_bn2binpad(bn, mine.data(), static_cast<int>(mine.size())) == static_cast<int>(mine.size()) && mine == buf;
}

// Whether a value OpenSSL read fits a TA buffer as the TA must take it.
bool fits(const BIGNUM *bn, size_t size) {
    return !BN_is_negative(bn) && !BN_is_zero(bn) && static_cast<size_t>(BN_num_bytes(bn)) <= size;
}

bool all_zero(const Bytes &b) {
    for (uint8_t v : b)
        if (v)
            return false;
    return true;
}

void check_decode(const Bytes &der, uint32_t r_size, uint32_t s_size) {
    Bytes r(r_size, 0xAA);
    Bytes s(s_size, 0xAA);
    const TEE_Result res = der_decode_ec_signature(
        der.empty() ? nullptr : der.data(), static_cast<uint32_t>(der.size()), r.data(), r_size, s.data(), s_size);
    Sig sig = openssl_decode(der);
    const BIGNUM *sr = nullptr;
    const BIGNUM *ss = nullptr;
    if (sig)
        ECDSA_SIG_get0(sig.get(), &sr, &ss);
    const bool canonical = sig && openssl_encode(sig.get()) == der;
    if (res == TEE_SUCCESS) {
        if (all_zero(r) || all_zero(s))
            return; // zero's own spelling, 02 00 (see check_encode)
        FUZZ_CHECK(canonical, "the decoder accepted what is not canonical DER: %s", to_hex(der).c_str());
        FUZZ_CHECK(same_value(sr, r) && same_value(ss, s), "the decoder read other values than OpenSSL: %s",
                   to_hex(der).c_str());
        return;
    }
    FUZZ_CHECK(res == TEE_ERROR_GENERIC, "the decoder failed with 0x%08x", res);
    FUZZ_CHECK(!(canonical && fits(sr, r_size) && fits(ss, s_size)), "the decoder refused canonical DER: %s",
               to_hex(der).c_str());
}

void check_encode(const Bytes &r, const Bytes &s) {
    uint32_t len = 0;
    uint8_t *der = der_encode_ec_signature(r.data(), static_cast<uint32_t>(r.size()), s.data(),
                                           static_cast<uint32_t>(s.size()), &len);
    FUZZ_CHECK(der != nullptr, "the encoder failed on %zu and %zu bytes", r.size(), s.size());
    const Bytes out(der, der + len);
    ta_free(der);
    // Zero is spelt as an INTEGER without content (02 00), which is no DER:
    // OpenSSL does not read it, and no signature has a zero half.
    if (all_zero(r) || all_zero(s))
        return;
    Sig sig = openssl_decode(out);
    FUZZ_CHECK(sig != nullptr, "OpenSSL cannot read the encoder's output: %s", to_hex(out).c_str());
    const BIGNUM *sr = nullptr;
    const BIGNUM *ss = nullptr;
    ECDSA_SIG_get0(sig.get(), &sr, &ss);
    FUZZ_CHECK(same_value(sr, r) && same_value(ss, s), "the encoder wrote other values: %s", to_hex(out).c_str());
    FUZZ_CHECK(openssl_encode(sig.get()) == out, "the encoder's output is not canonical: %s", to_hex(out).c_str());
    Bytes r2(r.size(), 0xAA);
    Bytes s2(s.size(), 0xAA);
    const TEE_Result res = der_decode_ec_signature(out.data(), len, r2.data(), static_cast<uint32_t>(r2.size()),
                                                   s2.data(), static_cast<uint32_t>(s2.size()));
    FUZZ_CHECK(res == TEE_SUCCESS && r2 == r && s2 == s, "the decoder does not read the encoder back: 0x%08x", res);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzTee::instance();
    HeapScope heap;
    FuzzInput in(data, size);
    const uint8_t mode = in.u8();
    if (mode & 1) {
        // Halves of 1 to 80 bytes: every curve's, and longer.
        const uint32_t r_len = 1 + in.below(80);
        const uint32_t s_len = 1 + in.below(80);
        const Bytes r = in.bytes(r_len);
        const Bytes s = in.bytes(s_len);
        if (r.size() == r_len && s.size() == s_len)
            check_encode(r, s);
        return 0;
    }
    // Buffers of 0 to 80 bytes each, then the DER.
    const uint32_t r_size = in.below(81);
    const uint32_t s_size = (mode & 2) ? r_size : in.below(81);
    check_decode(in.rest(), r_size, s_size);
    return 0;
}
