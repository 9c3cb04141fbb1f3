/*
 * softhsm.h - SoftHSM2 through PKCS#11, the benchmark's software-token
 * side: the module loaded at run time (km_bench runs without it), tokens
 * initialised in a temporary directory of the benchmark's own, keys made
 * from the same material the TA rows import, and the calls one timed
 * operation makes.
 *
 * Lifetimes: an Object keeps its Token, a Token its Module, so whatever a
 * row's closure holds stays usable; the last one gone finalises the module
 * and removes its directory.
 */
#ifndef KM_BENCH_SOFTHSM_H
#define KM_BENCH_SOFTHSM_H

#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include <openssl/evp.h>
#include <p11-kit/pkcs11.h>

#include "ta_session.h"

namespace bench::p11 {

// A PKCS#11 call that did not return CKR_OK: the call's name and the code.
class Failure : public std::runtime_error {
  public:
    Failure(const std::string &call, CK_RV rv);
    CK_RV rv;
};

// Module - SoftHSM2 loaded with dlopen and initialised on a softhsm2.conf
// of its own whose token directory is a fresh temporary directory, in
// memory (/dev/shm) where there is one: SoftHSM2 rewrites an object's file
// once per attribute it sets, which makes thousands of token objects slow
// to make on a disk. The destructor finalises, unloads and removes the
// directory.
class Module {
  public:
    // load - the module named by $KM_BENCH_SOFTHSM_MODULE, else the first
    // usual install place that has it, initialised. nullptr, with a reason
    // in *why, when there is none; throws Failure when the module is there
    // but does not initialise.
    static std::shared_ptr<Module> load(std::string *why);
    ~Module();
    Module(const Module &) = delete;
    Module &operator=(const Module &) = delete;

    CK_FUNCTION_LIST &fn() const { return *fn_; }
    const std::string &path() const { return path_; }
    // free_slot - a slot whose token is not initialised yet; SoftHSM2
    // always offers one more than it has tokens.
    CK_SLOT_ID free_slot() const;

  private:
    struct Unload {
        void operator()(void *handle) const;
    };
    Module(const std::string &path, const std::string &why_prefix);

    std::string path_;
    TempDir dir_;
    std::unique_ptr<void, Unload> library_;
    CK_FUNCTION_LIST *fn_ = nullptr;
};

// Storage - where an object lives: CKA_TOKEN false (the session's memory,
// SoftHSM2's fastest path) or true (the token's files).
enum class Storage { session, token };

// Token - a token initialised under `label` on a free slot, its user PIN
// set, and a read-write session logged in as that user. The destructor
// closes the session; the token's files go with the module's directory.
class Token {
  public:
    Token(std::shared_ptr<Module> module, const std::string &label);
    ~Token();
    Token(const Token &) = delete;
    Token &operator=(const Token &) = delete;

    const std::shared_ptr<Module> &module() const { return module_; }
    bool supports(CK_MECHANISM_TYPE mechanism) const;

    // sign - C_SignInit and C_Sign of in with key under mechanism. out's
    // size on entry is the room offered, on return what was written.
    void sign(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, Bytes &out);
    // verify - C_VerifyInit and C_Verify: true when the signature holds,
    // false when the token says it does not; throws on any other error.
    bool verify(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, const Bytes &signature);
    // encrypt - C_EncryptInit and a single-part C_Encrypt; out as for sign.
    void encrypt(CK_OBJECT_HANDLE key, const CK_MECHANISM &mechanism, const Bytes &in, Bytes &out);
    // find - the one object labelled `label`, found with C_FindObjectsInit,
    // C_FindObjects and C_FindObjectsFinal; throws when there is none.
    CK_OBJECT_HANDLE find(const std::string &label);

  private:
    friend class Object;
    void check(const char *call, CK_RV rv) const;

    std::shared_ptr<Module> module_;
    CK_FUNCTION_LIST &fn_;
    CK_SLOT_ID slot_ = 0;
    CK_SESSION_HANDLE session_ = CK_INVALID_HANDLE;
};

// Object - made with C_CreateObject from a template, destroyed with
// C_DestroyObject on destruction unless released.
class Object {
  public:
    Object(std::shared_ptr<Token> token, std::vector<CK_ATTRIBUTE> attributes);
    ~Object();
    Object(const Object &) = delete;
    Object &operator=(const Object &) = delete;

    Token &token() const { return *token_; }
    CK_OBJECT_HANDLE handle() const { return handle_; }
    // release - leaves the object on its token: for token objects by the
    // thousand, which go with the module's directory at once, where
    // SoftHSM2 would rescan the token's directory for each one destroyed.
    void release() { released_ = true; }

  private:
    std::shared_ptr<Token> token_;
    CK_OBJECT_HANDLE handle_ = CK_INVALID_HANDLE;
    bool released_ = false;
};

// Keys from the material the TA rows use. Secret and private keys are
// private and sensitive, as a token keeps real keys; label may be empty.
std::shared_ptr<Object> secret_key(const std::shared_ptr<Token> &token, CK_KEY_TYPE type, const Bytes &value,
                                   Storage storage, const std::string &label = {});
std::shared_ptr<Object> rsa_private_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage);
std::shared_ptr<Object> rsa_public_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage);
// ec_private_key - a P-256 key (the only curve the rows give SoftHSM2).
std::shared_ptr<Object> ec_private_key(const std::shared_ptr<Token> &token, EVP_PKEY *key, Storage storage);

// A mechanism without parameters.
inline CK_MECHANISM mechanism(CK_MECHANISM_TYPE type) {
    return CK_MECHANISM{type, nullptr, 0};
}

// GcmMechanism - CKM_AES_GCM with this IV, no AAD and a tag of tag_bits.
// The mechanism points into the object, so it stays where it was made.
class GcmMechanism {
  public:
    GcmMechanism(const Bytes &iv, unsigned tag_bits);
    GcmMechanism(const GcmMechanism &) = delete;
    GcmMechanism &operator=(const GcmMechanism &) = delete;
    const CK_MECHANISM &get() const { return mechanism_; }

  private:
    Bytes iv_;
    CK_GCM_PARAMS params_{};
    CK_MECHANISM mechanism_{};
};

// Signer - one signature with a key under a mechanism, over a message or,
// given prehash, over its digest taken inside the operation (for tokens
// that sign only digests, so that the work matches the others'); as a
// timed operation makes it.
class Signer {
  public:
    // room - the largest signature.
    Signer(std::shared_ptr<Object> key, CK_MECHANISM_TYPE mechanism, const Bytes &msg, size_t room,
           const EVP_MD *prehash = nullptr);
    // run - the signature; throws Failure when the token refuses.
    const Bytes &run();

  private:
    std::shared_ptr<Object> key_;
    CK_MECHANISM mechanism_;
    Bytes msg_;
    const EVP_MD *prehash_;
    Bytes digest_;
    Bytes out_;
};

// ecdsa_der - a PKCS#11 ECDSA signature (r and s, each half of it) as the
// DER ECDSA-Sig-Value OpenSSL verifies.
Bytes ecdsa_der(const Bytes &raw);

} // namespace bench::p11

#endif
