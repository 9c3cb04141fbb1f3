/*
 * key_material_fuzz.cpp - the normal world's key conversions on any bytes:
 * private keys to the TA's import material, the TA's exports to
 * SubjectPublicKeyInfo, PEM armour. What they produce has the layout the
 * TA reads (RSA: eight length-prefixed components; EC: a curve size and
 * three values of the field's width) or parses back in OpenSSL.
 */
#include <cstring>

#include <openssl/ec.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include "fuzz_support.h"
#include "keymaster_defs.h"
#include "km/key_material.h"

namespace {

// The length-prefixed fields of b from pos; false when one runs past the end.
bool fields(const Bytes &b, size_t pos, std::vector<size_t> *lengths) {
    while (pos < b.size()) {
        if (b.size() - pos < 4)
            return false;
        const size_t n = km::get_u32(b.data() + pos);
        pos += 4;
        if (b.size() - pos < n)
            return false;
        lengths->push_back(n);
        pos += n;
    }
    return true;
}

void check_rsa(const Bytes &in) {
    std::string why;
    const auto m = km::rsa_import_material(in, &why);
    if (!m)
        return;
    std::vector<size_t> lengths;
    FUZZ_CHECK(fields(*m, 0, &lengths) && lengths.size() == 8, "RSA material is not eight components");
    FUZZ_CHECK(lengths[0] > 0 && lengths[1] > 0 && lengths[2] > 0, "RSA material without n, e or d");
}

void check_ec(const Bytes &in) {
    std::string why;
    const auto m = km::ec_import_material(in, &why);
    if (!m)
        return;
    FUZZ_CHECK(m->size() >= 4, "EC material without a size");
    const uint32_t bits = km::get_u32(m->data());
    FUZZ_CHECK(bits == 192 || bits == 224 || bits == 256 || bits == 384 || bits == 521, "EC material of %u bits", bits);
    std::vector<size_t> lengths;
    FUZZ_CHECK(fields(*m, 4, &lengths) && lengths.size() == 3, "EC material is not x, y and d");
    for (size_t n : lengths)
        FUZZ_CHECK(n == (bits + 7) / 8, "EC value of %zu bytes on a %u-bit curve", n, bits);
}

void check_public(uint32_t algorithm, const Bytes &in) {
    std::string why;
    const auto der = km::public_key_der(algorithm, in, &why);
    if (!der)
        return;
    const unsigned char *p = der->data();
    EVP_PKEY *key = d2i_PUBKEY(nullptr, &p, static_cast<long>(der->size()));
    FUZZ_CHECK(key && p == der->data() + der->size(), "the SubjectPublicKeyInfo made does not parse");
    const int id = EVP_PKEY_get_base_id(key);
    EVP_PKEY_free(key);
    if (algorithm == KM_ALGORITHM_RSA)
        FUZZ_CHECK(id == EVP_PKEY_RSA && *der == in, "an RSA export is not passed on as it is");
    else
        FUZZ_CHECK(id == EVP_PKEY_EC, "an EC export became another kind of key");
}

void check_pem(const Bytes &der) {
    const std::string text = km::pem_encode("PUBLIC KEY", der);
    BIO *bio = BIO_new_mem_buf(text.data(), static_cast<int>(text.size()));
    char *name = nullptr;
    char *header = nullptr;
    unsigned char *body = nullptr;
    long len = 0;
    const bool read = bio && PEM_read_bio(bio, &name, &header, &body, &len) == 1;
    const bool same = read && std::strcmp(name, "PUBLIC KEY") == 0 && Bytes(body, body + len) == der;
    OPENSSL_free(name);
    OPENSSL_free(header);
    OPENSSL_free(body);
    BIO_free(bio);
    FUZZ_CHECK(same || der.empty(), "PEM of %zu bytes does not read back", der.size());
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    FuzzInput in(data, size);
    const uint8_t mode = in.u8();
    const Bytes rest = in.rest();
    switch (mode % 5) {
    case 0:
        check_rsa(rest);
        break;
    case 1:
        check_ec(rest);
        break;
    case 2:
        check_public(KM_ALGORITHM_EC, rest);
        break;
    case 3:
        check_public(KM_ALGORITHM_RSA, rest);
        break;
    default:
        check_pem(rest);
        break;
    }
    return 0;
}
