/*
 * softhsm.cpp - the PKCS#11 module, token, session and objects of the
 * benchmark's SoftHSM2 side.
 */
#include "softhsm.h"

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>

#include <dlfcn.h>
#include <unistd.h>

#include <openssl/bn.h>
#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/ec.h>

namespace bench::p11 {
namespace {

// Where Debian and other distributions install the module.
const char *const kModulePlaces[] = {
    "/usr/lib/softhsm/libsofthsm2.so",
    "/usr/lib/x86_64-linux-gnu/softhsm/libsofthsm2.so",
    "/usr/lib/aarch64-linux-gnu/softhsm/libsofthsm2.so",
    "/usr/lib64/pkcs11/libsofthsm2.so",
    "/usr/local/lib/softhsm/libsofthsm2.so",
};

// Only this benchmark's own throwaway tokens use these.
const std::string kSoPin = "km-bench-so";
const std::string kUserPin = "km-bench-user";

std::string hex(CK_RV rv) {
    char buf[24];
    std::snprintf(buf, sizeof buf, "0x%08lx", static_cast<unsigned long>(rv));
    return buf;
}

// PKCS#11 takes non-const pointers to what it only reads.
CK_UTF8CHAR *pin(const std::string &p) {
    return reinterpret_cast<CK_UTF8CHAR *>(const_cast<char *>(p.data()));
}

template <typename T> CK_ATTRIBUTE attr(CK_ATTRIBUTE_TYPE type, const T &value) {
    return CK_ATTRIBUTE{type, const_cast<T *>(&value), sizeof value};
}

CK_ATTRIBUTE attr_bytes(CK_ATTRIBUTE_TYPE type, const Bytes &value) {
    return CK_ATTRIBUTE{type, const_cast<uint8_t *>(value.data()), value.size()};
}

CK_ATTRIBUTE attr_text(CK_ATTRIBUTE_TYPE type, const std::string &value) {
    return CK_ATTRIBUTE{type, const_cast<char *>(value.data()), value.size()};
}

const CK_BBOOL kTrue = CK_TRUE;
const CK_BBOOL kFalse = CK_FALSE;

// A label field: blank-padded to 32 characters, not terminated.
std::string padded_label(const std::string &label) {
    std::string out = label.substr(0, 32);
    out.resize(32, ' ');
    return out;
}

// An integer component of an OpenSSL key, big-endian, at least `width` bytes.
Bytes bn_param(EVP_PKEY *key, const char *name, size_t width = 0) {
    BIGNUM *bn = nullptr;
    if (EVP_PKEY_get_bn_param(key, name, &bn) != 1)
        throw std::runtime_error(std::string("key component ") + name + " not available");
    const size_t n = std::max(width, static_cast<size_t>(BN_num_bytes(bn)));
    Bytes out(n);
    const int written = BN_bn2binpad(bn, out.data(), static_cast<int>(n));
    BN_clear_free(bn);
    if (written < 0)
        throw std::runtime_error(std::string("key component ") + name + " not converted");
    return out;
}

// The template's private components are wiped once the token has its copy.
struct Wiped {
    std::vector<Bytes> parts;
    ~Wiped() {
        for (Bytes &b : parts)
            OPENSSL_cleanse(b.data(), b.size());
    }
};

std::vector<CK_ATTRIBUTE> key_header(const CK_OBJECT_CLASS &cls, const CK_KEY_TYPE &type, Storage storage) {
    const bool secret = cls != CKO_PUBLIC_KEY;
    return {
        attr(CKA_CLASS, cls),
        attr(CKA_KEY_TYPE, type),
        attr(CKA_TOKEN, storage == Storage::token ? kTrue : kFalse),
        attr(CKA_PRIVATE, secret ? kTrue : kFalse),
    };
}

void add_secret_flags(std::vector<CK_ATTRIBUTE> &t) {
    t.push_back(attr(CKA_SENSITIVE, kTrue));
    t.push_back(attr(CKA_EXTRACTABLE, kFalse));
}

const CK_OBJECT_CLASS kSecretClass = CKO_SECRET_KEY;
const CK_OBJECT_CLASS kPrivateClass = CKO_PRIVATE_KEY;
const CK_OBJECT_CLASS kPublicClass = CKO_PUBLIC_KEY;
const CK_KEY_TYPE kRsaType = CKK_RSA;
const CK_KEY_TYPE kEcType = CKK_EC;

// DER of the OID prime256v1, CKA_EC_PARAMS' named-curve form.
const Bytes kP256Params = {0x06, 0x08, 0x2a, 0x86, 0x48, 0xce, 0x3d, 0x03, 0x01, 0x07};

} // namespace

Failure::Failure(const std::string &call, CK_RV code) : std::runtime_error(call + " failed: " + hex(code)), rv(code) {}

void Module::Unload::operator()(void *handle) const {
    dlclose(handle);
}

std::shared_ptr<Module> Module::load(std::string *why) {
    std::string path;
    const char *chosen = std::getenv("KM_BENCH_SOFTHSM_MODULE");
    if (chosen && *chosen) {
        if (access(chosen, R_OK) == 0)
            path = chosen;
        else
            *why = std::string("no module at ") + chosen + " (KM_BENCH_SOFTHSM_MODULE)";
    } else {
        for (const char *place : kModulePlaces) {
            if (access(place, R_OK) == 0) {
                path = place;
                break;
            }
        }
        if (path.empty())
            *why = "libsofthsm2.so not installed (scripts/bench_deps.sh installs it)";
    }
    if (path.empty())
        return nullptr;
    try {
        return std::shared_ptr<Module>(new Module(path, path + ": "));
    } catch (const std::exception &e) {
        *why = e.what();
        return nullptr;
    }
}

namespace {

std::filesystem::path token_parent() {
    std::error_code ec;
    if (std::filesystem::is_directory("/dev/shm", ec) && access("/dev/shm", W_OK) == 0)
        return "/dev/shm";
    return {};
}

} // namespace

Module::Module(const std::string &path, const std::string &why_prefix)
    : path_(path), dir_("km-bench-softhsm", token_parent()) {
    const std::filesystem::path tokens = dir_.path() / "tokens";
    const std::filesystem::path conf = dir_.path() / "softhsm2.conf";
    std::filesystem::create_directory(tokens);
    {
        std::ofstream out(conf);
        out << "directories.tokendir = " << tokens.string() << "\n"
            << "objectstore.backend = file\n"
            << "log.level = ERROR\n"
            << "slots.removable = false\n";
        if (!out)
            throw std::runtime_error(why_prefix + "cannot write " + conf.string());
    }
    // SoftHSM2 reads its configuration in C_Initialize.
    setenv("SOFTHSM2_CONF", conf.c_str(), 1);
    library_.reset(dlopen(path.c_str(), RTLD_NOW | RTLD_LOCAL));
    if (!library_)
        throw std::runtime_error(why_prefix + dlerror());
    auto get_list = reinterpret_cast<CK_C_GetFunctionList>(dlsym(library_.get(), "C_GetFunctionList"));
    if (!get_list)
        throw std::runtime_error(why_prefix + "no C_GetFunctionList");
    CK_FUNCTION_LIST *fn = nullptr;
    CK_RV rv = get_list(&fn);
    if (rv != CKR_OK || !fn)
        throw Failure(why_prefix + "C_GetFunctionList", rv);
    rv = fn->C_Initialize(nullptr);
    if (rv != CKR_OK)
        throw Failure(why_prefix + "C_Initialize", rv);
    fn_ = fn;
}

Module::~Module() {
    fn_->C_Finalize(nullptr);
}

CK_SLOT_ID Module::free_slot() const {
    CK_ULONG n = 0;
    CK_RV rv = fn_->C_GetSlotList(CK_FALSE, nullptr, &n);
    std::vector<CK_SLOT_ID> slots(n);
    if (rv == CKR_OK)
        rv = fn_->C_GetSlotList(CK_FALSE, slots.data(), &n);
    if (rv != CKR_OK)
        throw Failure("C_GetSlotList", rv);
    slots.resize(n);
    for (CK_SLOT_ID slot : slots) {
        CK_TOKEN_INFO info{};
        if (fn_->C_GetTokenInfo(slot, &info) == CKR_OK && !(info.flags & CKF_TOKEN_INITIALIZED))
            return slot;
    }
    throw std::runtime_error("SoftHSM2 offers no free slot");
}

Token::Token(std::shared_ptr<Module> module, const std::string &label)
    : module_(std::move(module)), fn_(module_->fn()) {
    const std::string field = padded_label(label);
    const CK_SLOT_ID free = module_->free_slot();
    check("C_InitToken", fn_.C_InitToken(free, pin(kSoPin), kSoPin.size(),
                                         reinterpret_cast<CK_UTF8CHAR *>(const_cast<char *>(field.data()))));
    // The initialised token may be given another slot number: find it by label.
    CK_ULONG n = 0;
    check("C_GetSlotList", fn_.C_GetSlotList(CK_TRUE, nullptr, &n));
    std::vector<CK_SLOT_ID> slots(n);
    check("C_GetSlotList", fn_.C_GetSlotList(CK_TRUE, slots.data(), &n));
    slots.resize(n);
    bool found = false;
    for (CK_SLOT_ID slot : slots) {
        CK_TOKEN_INFO info{};
        if (fn_.C_GetTokenInfo(slot, &info) == CKR_OK && (info.flags & CKF_TOKEN_INITIALIZED) &&
            std::memcmp(info.label, field.data(), sizeof info.label) == 0) {
            slot_ = slot;
            found = true;
            break;
        }
    }
    if (!found)
        throw std::runtime_error("SoftHSM2 token " + label + " not found after C_InitToken");
    check("C_OpenSession", fn_.C_OpenSession(slot_, CKF_SERIAL_SESSION | CKF_RW_SESSION, nullptr, nullptr, &session_));
    try {
        check("C_Login", fn_.C_Login(session_, CKU_SO, pin(kSoPin), kSoPin.size()));
        check("C_InitPIN", fn_.C_InitPIN(session_, pin(kUserPin), kUserPin.size()));
        check("C_Logout", fn_.C_Logout(session_));
        check("C_Login", fn_.C_Login(session_, CKU_USER, pin(kUserPin), kUserPin.size()));
    } catch (...) {
        fn_.C_CloseSession(session_);
        throw;
    }
}

Token::~Token() {
    fn_.C_CloseSession(session_);
}

void Token::check(const char *call, CK_RV rv) const {
    if (rv != CKR_OK)
        throw Failure(call, rv);
}

bool Token::supports(CK_MECHANISM_TYPE type) const {
    CK_MECHANISM_INFO info{};
    return fn_.C_GetMechanismInfo(slot_, type, &info) == CKR_OK;
}

void Token::sign(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, Bytes &out) {
    check("C_SignInit", fn_.C_SignInit(session_, const_cast<CK_MECHANISM *>(&mechanism), key));
    CK_ULONG len = out.size();
    check("C_Sign", fn_.C_Sign(session_, const_cast<uint8_t *>(in.data()), in.size(), out.data(), &len));
    out.resize(len);
}

bool Token::verify(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, const Bytes &signature) {
    check("C_VerifyInit", fn_.C_VerifyInit(session_, const_cast<CK_MECHANISM *>(&mechanism), key));
    const CK_RV rv = fn_.C_Verify(session_, const_cast<uint8_t *>(in.data()), in.size(),
                                  const_cast<uint8_t *>(signature.data()), signature.size());
    if (rv == CKR_SIGNATURE_INVALID || rv == CKR_SIGNATURE_LEN_RANGE)
        return false;
    check("C_Verify", rv);
    return true;
}

void Token::encrypt(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, Bytes &out) {
    check("C_EncryptInit", fn_.C_EncryptInit(session_, const_cast<CK_MECHANISM *>(&mechanism), key));
    CK_ULONG len = out.size();
    check("C_Encrypt", fn_.C_Encrypt(session_, const_cast<uint8_t *>(in.data()), in.size(), out.data(), &len));
    out.resize(len);
}

CK_OBJECT_HANDLE Token::find(const std::string &label) {
    CK_ATTRIBUTE query[] = {attr_text(CKA_LABEL, label)};
    check("C_FindObjectsInit", fn_.C_FindObjectsInit(session_, query, 1));
    CK_OBJECT_HANDLE handle = CK_INVALID_HANDLE;
    CK_ULONG n = 0;
    const CK_RV rv = fn_.C_FindObjects(session_, &handle, 1, &n);
    // The search ends whatever it found.
    check("C_FindObjectsFinal", fn_.C_FindObjectsFinal(session_));
    check("C_FindObjects", rv);
    if (n != 1)
        throw std::runtime_error("SoftHSM2 has no object labelled " + label);
    return handle;
}

Object::Object(std::shared_ptr<Token> token, std::vector<CK_ATTRIBUTE> attributes) : token_(std::move(token)) {
    token_->check("C_CreateObject",
                  token_->fn_.C_CreateObject(token_->session_, attributes.data(), attributes.size(), &handle_));
}

Object::~Object() {
    if (!released_)
        token_->fn_.C_DestroyObject(token_->session_, handle_);
}

std::shared_ptr<Object> secret_key(const std::shared_ptr<Token> &token, CK_KEY_TYPE type, const Bytes &value,
                                   Storage storage, const std::string &label) {
    std::vector<CK_ATTRIBUTE> t = key_header(kSecretClass, type, storage);
    add_secret_flags(t);
    t.push_back(attr(type == CKK_AES ? CKA_ENCRYPT : CKA_SIGN, kTrue));
    t.push_back(attr_bytes(CKA_VALUE, value));
    if (!label.empty())
        t.push_back(attr_text(CKA_LABEL, label));
    return std::make_shared<Object>(token, std::move(t));
}

std::shared_ptr<Object> rsa_private_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage) {
    const Bytes n = bn_param(key, OSSL_PKEY_PARAM_RSA_N);
    const Bytes e = bn_param(key, OSSL_PKEY_PARAM_RSA_E);
    Wiped secret;
    const CK_ATTRIBUTE_TYPE types[] = {CKA_PRIVATE_EXPONENT, CKA_PRIME_1,    CKA_PRIME_2,
                                       CKA_EXPONENT_1,       CKA_EXPONENT_2, CKA_COEFFICIENT};
    const char *names[] = {OSSL_PKEY_PARAM_RSA_D,         OSSL_PKEY_PARAM_RSA_FACTOR1,
                           OSSL_PKEY_PARAM_RSA_FACTOR2,   OSSL_PKEY_PARAM_RSA_EXPONENT1,
                           OSSL_PKEY_PARAM_RSA_EXPONENT2, OSSL_PKEY_PARAM_RSA_COEFFICIENT1};
    for (const char *name : names)
        secret.parts.push_back(bn_param(key, name));
    std::vector<CK_ATTRIBUTE> t = key_header(kPrivateClass, kRsaType, storage);
    add_secret_flags(t);
    t.push_back(attr(CKA_SIGN, kTrue));
    t.push_back(attr_bytes(CKA_MODULUS, n));
    t.push_back(attr_bytes(CKA_PUBLIC_EXPONENT, e));
    for (size_t i = 0; i < secret.parts.size(); ++i)
        t.push_back(attr_bytes(types[i], secret.parts[i]));
    return std::make_shared<Object>(token, std::move(t));
}

std::shared_ptr<Object> rsa_public_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage) {
    const Bytes n = bn_param(key, OSSL_PKEY_PARAM_RSA_N);
    const Bytes e = bn_param(key, OSSL_PKEY_PARAM_RSA_E);
    std::vector<CK_ATTRIBUTE> t = key_header(kPublicClass, kRsaType, storage);
    t.push_back(attr(CKA_VERIFY, kTrue));
    t.push_back(attr_bytes(CKA_MODULUS, n));
    t.push_back(attr_bytes(CKA_PUBLIC_EXPONENT, e));
    return std::make_shared<Object>(token, std::move(t));
}

std::shared_ptr<Object> ec_private_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage) {
    char group[32] = {};
    if (EVP_PKEY_get_utf8_string_param(key, OSSL_PKEY_PARAM_GROUP_NAME, group, sizeof group, nullptr) != 1 ||
        std::string(group) != "prime256v1")
        throw std::runtime_error("SoftHSM2 rows take P-256 keys only");
    Wiped secret;
    secret.parts.push_back(bn_param(key, OSSL_PKEY_PARAM_PRIV_KEY, 32));
    std::vector<CK_ATTRIBUTE> t = key_header(kPrivateClass, kEcType, storage);
    add_secret_flags(t);
    t.push_back(attr(CKA_SIGN, kTrue));
    t.push_back(attr_bytes(CKA_EC_PARAMS, kP256Params));
    t.push_back(attr_bytes(CKA_VALUE, secret.parts[0]));
    return std::make_shared<Object>(token, std::move(t));
}

GcmMechanism::GcmMechanism(const Bytes &iv, unsigned tag_bits) : iv_(iv) {
    params_.pIv = iv_.data();
    params_.ulIvLen = iv_.size();
    params_.ulIvBits = iv_.size() * 8;
    params_.ulTagBits = tag_bits;
    mechanism_ = CK_MECHANISM{CKM_AES_GCM, &params_, sizeof params_};
}

Signer::Signer(std::shared_ptr<Object> key, CK_MECHANISM_TYPE type, const Bytes &msg, size_t room,
               const EVP_MD *prehash)
    : key_(std::move(key)), mechanism_(mechanism(type)), msg_(msg), prehash_(prehash), digest_(EVP_MAX_MD_SIZE),
      out_(room) {}

const Bytes &Signer::run() {
    if (prehash_) {
        unsigned int n = 0;
        digest_.resize(EVP_MAX_MD_SIZE);
        if (EVP_Digest(msg_.data(), msg_.size(), digest_.data(), &n, prehash_, nullptr) != 1)
            throw std::runtime_error("EVP_Digest failed");
        digest_.resize(n);
    }
    out_.resize(out_.capacity());
    key_->token().sign(key_->handle(), mechanism_, prehash_ ? digest_ : msg_, out_);
    return out_;
}

Bytes ecdsa_der(const Bytes &raw) {
    const int half = static_cast<int>(raw.size() / 2);
    ECDSA_SIG *sig = ECDSA_SIG_new();
    BIGNUM *r = BN_bin2bn(raw.data(), half, nullptr);
    BIGNUM *s = BN_bin2bn(raw.data() + half, half, nullptr);
    if (!sig || !r || !s || ECDSA_SIG_set0(sig, r, s) != 1) {
        BN_free(r);
        BN_free(s);
        ECDSA_SIG_free(sig);
        throw std::runtime_error("ECDSA signature conversion failed");
    }
    unsigned char *der = nullptr;
    const int n = i2d_ECDSA_SIG(sig, &der);
    ECDSA_SIG_free(sig);
    if (n <= 0)
        throw std::runtime_error("ECDSA signature encoding failed");
    Bytes out(der, der + n);
    OPENSSL_free(der);
    return out;
}

} // namespace bench::p11
