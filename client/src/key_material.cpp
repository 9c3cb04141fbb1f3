/*
 * key_material.cpp - private keys to import material, exports to
 * SubjectPublicKeyInfo, PEM armour.
 */
#include "km/key_material.h"

#include <cstring>
#include <memory>
#include <new>
#include <string_view>

#include <openssl/bio.h>
#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/decoder.h>
#include <openssl/ec.h>
#include <openssl/err.h>
#include <openssl/evp.h>
#include <openssl/obj_mac.h>
#include <openssl/objects.h>
#include <openssl/param_build.h>
#include <openssl/pem.h>
#include <openssl/x509.h>

#include "keymaster_defs.h"

namespace km {
namespace {

struct Free {
    void operator()(EVP_PKEY *p) const { EVP_PKEY_free(p); }
    void operator()(EVP_PKEY_CTX *p) const { EVP_PKEY_CTX_free(p); }
    void operator()(BIO *p) const { BIO_free(p); }
    void operator()(BIGNUM *p) const { BN_clear_free(p); }
};
template <typename T> using Owned = std::unique_ptr<T, Free>;

// OpenSSL's error queue is per thread; leaving entries behind would blame
// a later, unrelated call.
struct ClearErrors {
    ~ClearErrors() { ERR_clear_error(); }
};

struct Curve {
    int nid;
    uint32_t bits;
};
constexpr Curve kCurves[] = {
    {NID_X9_62_prime192v1, 192}, {NID_secp224r1, 224}, {NID_X9_62_prime256v1, 256},
    {NID_secp384r1, 384},        {NID_secp521r1, 521},
};

bool fail(std::string *why, std::string reason) {
    *why = std::move(reason);
    return false;
}

struct PassphraseState {
    const Passphrase *source;
    bool asked = false;
    bool refused = false; // no passphrase could be had
};

// OpenSSL asks for the passphrase only when the key is encrypted.
int passphrase_cb(char *buf, size_t size, size_t *len, const OSSL_PARAM[], void *arg) {
    auto *st = static_cast<PassphraseState *>(arg);
    st->asked = true;
    std::optional<std::string> pass = *st->source ? (*st->source)() : std::nullopt;
    if (!pass || pass->size() > size) {
        st->refused = !pass;
        if (pass)
            OPENSSL_cleanse(pass->data(), pass->size());
        return 0;
    }
    std::memcpy(buf, pass->data(), pass->size());
    *len = pass->size();
    OPENSSL_cleanse(pass->data(), pass->size());
    return 1;
}

// Any private key OpenSSL writes by default: PKCS#8 (plain or encrypted)
// or the traditional per-algorithm form, PEM or DER, through OpenSSL's own
// decoders. The whole input must be one key.
Owned<EVP_PKEY> read_private_key(std::span<const uint8_t> in, const Passphrase &passphrase, std::string *why) {
    if (in.empty() || in.size() > INT32_MAX) {
        fail(why, "the key file is empty or too large");
        return nullptr;
    }
    EVP_PKEY *raw = nullptr;
    std::unique_ptr<OSSL_DECODER_CTX, decltype(&OSSL_DECODER_CTX_free)> ctx(
        OSSL_DECODER_CTX_new_for_pkey(&raw, nullptr, nullptr, nullptr, OSSL_KEYMGMT_SELECT_KEYPAIR, nullptr, nullptr),
        &OSSL_DECODER_CTX_free);
    PassphraseState st{&passphrase};
    if (!ctx || OSSL_DECODER_CTX_set_passphrase_cb(ctx.get(), passphrase_cb, &st) != 1) {
        fail(why, "OpenSSL has no decoder for private keys");
        return nullptr;
    }
    const unsigned char *p = in.data();
    size_t left = in.size();
    const bool decoded = OSSL_DECODER_from_data(ctx.get(), &p, &left) == 1;
    Owned<EVP_PKEY> key(raw);
    if (decoded && key) {
        // PEM may be followed by text; DER must be the key and nothing else.
        const bool pem = std::string_view(reinterpret_cast<const char *>(in.data()), in.size()).find("-----BEGIN") !=
                         std::string_view::npos;
        if (pem || left == 0)
            return key;
        fail(why, "not a private key: bytes follow the DER key");
        return nullptr;
    }
    if (st.refused)
        fail(why, "the key is encrypted: give its passphrase with --passin");
    else if (st.asked)
        fail(why, "the passphrase does not decrypt the key");
    else
        fail(why, "not a private key in a form OpenSSL reads (PKCS#8 or traditional, PEM or DER)");
    return nullptr;
}

bool put_bn(Bytes &out, const EVP_PKEY *key, const char *name, size_t width, std::string *why) {
    BIGNUM *raw = nullptr;
    if (EVP_PKEY_get_bn_param(key, name, &raw) != 1)
        return fail(why, std::string("the key has no ") + name);
    Owned<BIGNUM> bn(raw);
    const int natural = BN_num_bytes(bn.get());
    const size_t n = width ? width : static_cast<size_t>(natural);
    if (static_cast<size_t>(natural) > n)
        return fail(why, std::string("the key's ") + name + " is too long for its curve");
    put_u32(out, static_cast<uint32_t>(n));
    const size_t at = out.size();
    out.resize(at + n);
    if (n && BN_bn2binpad(bn.get(), out.data() + at, static_cast<int>(n)) < 0)
        return fail(why, std::string("the key's ") + name + " does not encode");
    return true;
}

const Curve *curve_of(const EVP_PKEY *key) {
    char name[80] = {};
    size_t len = 0;
    if (EVP_PKEY_get_utf8_string_param(key, OSSL_PKEY_PARAM_GROUP_NAME, name, sizeof name, &len) != 1)
        return nullptr;
    int nid = OBJ_sn2nid(name);
    if (nid == NID_undef)
        nid = EC_curve_nist2nid(name);
    for (const Curve &c : kCurves)
        if (c.nid == nid)
            return &c;
    return nullptr;
}

const Curve *curve_of_bits(uint32_t bits) {
    for (const Curve &c : kCurves)
        if (c.bits == bits)
            return &c;
    return nullptr;
}

// Reads a u32 length and that many bytes; false when they do not fit.
bool take_lv(std::span<const uint8_t> in, size_t *pos, std::span<const uint8_t> *field) {
    if (in.size() - *pos < 4)
        return false;
    const uint32_t n = get_u32(in.data() + *pos);
    *pos += 4;
    if (in.size() - *pos < n)
        return false;
    *field = in.subspan(*pos, n);
    *pos += n;
    return true;
}

// value left-padded with zeros to width; false when it is longer.
bool pad_to(std::span<const uint8_t> value, size_t width, Bytes &out) {
    // Leading zeros beyond the width carry no value.
    while (value.size() > width && value.front() == 0)
        value = value.subspan(1);
    if (value.size() > width)
        return false;
    out.insert(out.end(), width - value.size(), 0);
    out.insert(out.end(), value.begin(), value.end());
    return true;
}

std::optional<Bytes> ec_spki(std::span<const uint8_t> exported, std::string *why) {
    size_t pos = 4;
    std::span<const uint8_t> x, y;
    if (exported.size() < 4 || !take_lv(exported, &pos, &x) || !take_lv(exported, &pos, &y)) {
        *why = "the exported EC key is truncated";
        return std::nullopt;
    }
    const Curve *curve = curve_of_bits(get_u32(exported.data()));
    if (!curve) {
        *why = "the exported EC key has an unknown size " + std::to_string(get_u32(exported.data()));
        return std::nullopt;
    }
    const size_t width = (curve->bits + 7) / 8;
    Bytes point = {0x04}; // uncompressed
    if (!pad_to(x, width, point) || !pad_to(y, width, point)) {
        *why = "the exported EC point is too long for its curve";
        return std::nullopt;
    }
    OSSL_PARAM params[] = {
        OSSL_PARAM_construct_utf8_string(OSSL_PKEY_PARAM_GROUP_NAME, const_cast<char *>(OBJ_nid2sn(curve->nid)), 0),
        OSSL_PARAM_construct_octet_string(OSSL_PKEY_PARAM_PUB_KEY, point.data(), point.size()),
        OSSL_PARAM_construct_end(),
    };
    Owned<EVP_PKEY_CTX> ctx(EVP_PKEY_CTX_new_from_name(nullptr, "EC", nullptr));
    EVP_PKEY *raw = nullptr;
    if (!ctx || EVP_PKEY_fromdata_init(ctx.get()) != 1 ||
        EVP_PKEY_fromdata(ctx.get(), &raw, EVP_PKEY_PUBLIC_KEY, params) != 1) {
        *why = "the exported EC point is not on its curve";
        return std::nullopt;
    }
    Owned<EVP_PKEY> key(raw);
    unsigned char *der = nullptr;
    const int n = i2d_PUBKEY(key.get(), &der);
    if (n <= 0) {
        *why = "the EC public key does not encode";
        return std::nullopt;
    }
    Bytes out(der, der + n);
    OPENSSL_free(der);
    return out;
}

} // namespace

std::optional<Bytes> rsa_import_material(std::span<const uint8_t> key_file, std::string *why) {
    return rsa_import_material(key_file, Passphrase(), why);
}

std::optional<Bytes> rsa_import_material(std::span<const uint8_t> key_file, const Passphrase &passphrase,
                                         std::string *why) {
    ClearErrors clear;
    Owned<EVP_PKEY> key = read_private_key(key_file, passphrase, why);
    if (!key)
        return std::nullopt;
    if (EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA) {
        *why = "the key is not an RSA key";
        return std::nullopt;
    }
    static const char *const kComponents[] = {
        OSSL_PKEY_PARAM_RSA_N,         OSSL_PKEY_PARAM_RSA_E,
        OSSL_PKEY_PARAM_RSA_D,         OSSL_PKEY_PARAM_RSA_FACTOR1,
        OSSL_PKEY_PARAM_RSA_FACTOR2,   OSSL_PKEY_PARAM_RSA_EXPONENT1,
        OSSL_PKEY_PARAM_RSA_EXPONENT2, OSSL_PKEY_PARAM_RSA_COEFFICIENT1,
    };
    Bytes out;
    for (const char *name : kComponents)
        if (!put_bn(out, key.get(), name, 0, why))
            return std::nullopt;
    return out;
}

std::optional<Bytes> ec_import_material(std::span<const uint8_t> key_file, std::string *why) {
    return ec_import_material(key_file, Passphrase(), why);
}

std::optional<Bytes> ec_import_material(std::span<const uint8_t> key_file, const Passphrase &passphrase,
                                        std::string *why) {
    ClearErrors clear;
    Owned<EVP_PKEY> key = read_private_key(key_file, passphrase, why);
    if (!key)
        return std::nullopt;
    if (EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_EC) {
        *why = "the key is not an EC key";
        return std::nullopt;
    }
    const Curve *curve = curve_of(key.get());
    if (!curve) {
        char name[80] = {};
        size_t len = 0;
        const bool named =
            EVP_PKEY_get_utf8_string_param(key.get(), OSSL_PKEY_PARAM_GROUP_NAME, name, sizeof name, &len) == 1;
        *why = std::string("the EC key is on ") + (named ? name : "an unnamed curve") +
               ", not on P-192, P-224, P-256, P-384 or P-521";
        return std::nullopt;
    }
    const size_t width = (curve->bits + 7) / 8;
    Bytes out;
    put_u32(out, curve->bits);
    if (!put_bn(out, key.get(), OSSL_PKEY_PARAM_EC_PUB_X, width, why) ||
        !put_bn(out, key.get(), OSSL_PKEY_PARAM_EC_PUB_Y, width, why) ||
        !put_bn(out, key.get(), OSSL_PKEY_PARAM_PRIV_KEY, width, why))
        return std::nullopt;
    return out;
}

std::optional<Bytes> public_key_der(uint32_t algorithm, std::span<const uint8_t> exported, std::string *why) {
    ClearErrors clear;
    if (algorithm == KM_ALGORITHM_EC)
        return ec_spki(exported, why);
    if (algorithm != KM_ALGORITHM_RSA) {
        *why = "only RSA and EC keys have a public key to export";
        return std::nullopt;
    }
    const unsigned char *p = exported.data();
    Owned<EVP_PKEY> key(exported.size() <= INT32_MAX ? d2i_PUBKEY(nullptr, &p, static_cast<long>(exported.size()))
                                                     : nullptr);
    if (!key || p != exported.data() + exported.size() || EVP_PKEY_get_base_id(key.get()) != EVP_PKEY_RSA) {
        *why = "the exported RSA key is not a DER SubjectPublicKeyInfo";
        return std::nullopt;
    }
    return Bytes(exported.begin(), exported.end());
}

std::string pem_encode(std::string_view label, std::span<const uint8_t> der) {
    ClearErrors clear;
    Owned<BIO> bio(BIO_new(BIO_s_mem()));
    const std::string name(label);
    if (!bio || der.size() > INT32_MAX)
        throw std::bad_alloc();
    // It counts the base64 it wrote: 0 for an empty body, armour and all.
    const int written = PEM_write_bio(bio.get(), name.c_str(), "", der.data(), static_cast<long>(der.size()));
    if (written < 0 || (written == 0 && !der.empty()))
        throw std::bad_alloc();
    char *text = nullptr;
    const long n = BIO_get_mem_data(bio.get(), &text);
    return std::string(text, static_cast<size_t>(n));
}

} // namespace km
