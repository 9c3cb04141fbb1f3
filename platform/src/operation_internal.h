/*
 * operation_internal.h - the operation handle layer shared by the crypto
 * backends: what an operation holds, the state checks every family makes,
 * and the hook each family provides for TEE_AllocateOperation.
 *
 * A family (digest, MAC, cipher, AE, RSA, EC) is one source file
 * with a setup function and an Engine subclass. crypto_operation.cpp owns
 * the handle, the key, the class/mode/state checks, copy and reset, and
 * routes TEE_AllocateOperation to a family by operation class.
 */
#ifndef OPERATION_INTERNAL_H
#define OPERATION_INTERNAL_H

#include <cstddef>
#include <cstdint>
#include <memory>

#include <openssl/evp.h>

#include "object_internal.h"

namespace tee_host::detail {

struct Operation;

// The per-algorithm half of an operation. A family's TEE_ functions
// reach their own subclass by static_cast after operation_from_handle has
// checked the class, so each class must map to one Engine subclass (or, for
// the asymmetric classes, subclasses of AsymmetricEngine).
class Engine {
  public:
    virtual ~Engine() = default;
    // accepts_key - whether an object of this type can key the operation.
    virtual bool accepts_key(uint32_t object_type) const = 0;
    // accepts_key_size - whether a key of this size in bits (no larger
    // than the operation's maximum) suits the algorithm.
    virtual bool accepts_key_size(uint32_t) const { return true; }
    // reset - abandons any computation in progress, wiping its state. The
    // key (op.key) stays; engines read it again at their Init.
    virtual void reset() = 0;
    // rekey - the key is changing: drop anything derived from the old one.
    virtual void rekey() { reset(); }
    // clone - a deep copy of the engine's state for TEE_CopyOperation.
    // Panics when the backend cannot copy.
    virtual std::unique_ptr<Engine> clone() const = 0;
};

struct Operation {
    const void *owner = nullptr; // the TA whose call made it; reclaimed with that instance
    // algorithm, operationClass, mode, digestLength, maxKeySize, keySize,
    // requiredKeyUsage and handleState (TEE_HANDLE_FLAG_*), as reported.
    TEE_OperationInfo info{};
    bool active = false;         // TEE_OPERATION_STATE_ACTIVE
    std::unique_ptr<Object> key; // the operation's own copy of its key
    std::unique_ptr<Engine> engine;
};

// digest_setup, mac_setup, cipher_setup, ae_setup - a family's part of
// TEE_AllocateOperation, called with info.algorithm, mode and maxKeySize
// filled and operationClass taken from the algorithm. TEE_SUCCESS: it has
// set digestLength, requiredKeyUsage, any handleState flags and the engine
// (owned by op). TEE_ERROR_NOT_SUPPORTED for an algorithm, mode or
// maxKeySize it does not do; TEE_ERROR_OUT_OF_MEMORY.
TEE_Result digest_setup(Operation &op); // crypto_digest.cpp
TEE_Result mac_setup(Operation &op);    // crypto_mac.cpp
TEE_Result cipher_setup(Operation &op); // crypto_cipher.cpp
TEE_Result ae_setup(Operation &op);     // crypto_ae.cpp

// operation_from_handle - the operation behind a handle. Panics (naming
// fn) on a null, unknown or freed handle, or when its class is not `cls`.
Operation &operation_from_handle(TEE_OperationHandle handle, uint32_t cls, const char *fn);

// require_mode / require_key / require_initialized - return when the
// operation has that mode, a key, or a completed Init; panic naming fn
// otherwise.
void require_mode(const Operation &op, uint32_t mode, const char *fn);
void require_key(const Operation &op, const char *fn);
void require_initialized(const Operation &op, const char *fn);

// begin - the family's Init succeeded: the operation is initialized and active.
void begin(Operation &op);
// finish - a final call ended the computation: back to the initial state,
// needing a new Init (digests stay initialized).
void finish(Operation &op);

// secret_value - the operation key's TEE_ATTR_SECRET_VALUE (panics without one).
const SecretBytes &secret_value(const Operation &op);

// output_fits - whether the capacity *len holds `needed` bytes; when not,
// *len becomes `needed` for the TEE_ERROR_SHORT_BUFFER answer. Panics when
// len is null or needed cannot be expressed in 32 bits.
bool output_fits(uint32_t *len, size_t needed, const char *fn);

// InputView - input that may overlap the output: a private (wiped) copy
// when the ranges overlap, since EVP may read input after writing output.
// in_place: the caller's backend processes input and output at the very
// same address correctly (it never writes ahead of what it has read), so
// that case needs no copy. Panics on null input with a nonzero length,
// naming fn.
class InputView {
  public:
    InputView(const void *src, size_t len, const void *dst, size_t dst_len, const char *fn, bool in_place = false);
    const uint8_t *data() const { return copy_.empty() ? src_ : copy_.data(); }
    size_t size() const { return len_; }

  private:
    const uint8_t *src_;
    size_t len_;
    SecretBytes copy_;
};

// cipher_update - EVP_CipherUpdate over a length of any size (EVP takes
// int). out may be null for AAD. *written is the total output. false on a
// backend failure.
bool cipher_update(EVP_CIPHER_CTX *ctx, uint8_t *out, const uint8_t *in, size_t len, size_t *written);

// The hashes GP numbers 1 (MD5) to 6 (SHA-512) in its algorithm
// identifiers, as OpenSSL names them.
struct HashInfo {
    const char *name;
    uint32_t size;      // bytes
    uint32_t hmac_type; // the TEE_TYPE_HMAC_* keyed by this hash
};
// hash_info - the hash with that GP number, or null.
const HashInfo *hash_info(uint32_t gp_hash);

// The asymmetric classes (asymmetric cipher and signature, and the export
// extension) are served by engines deriving from this.
// encrypt, decrypt, sign_digest, verify_digest, export_key - the GP call of
// the same name once crypto_operation.cpp has checked class, mode, key,
// parameter and buffer pointers; results as that call's. *dst_len, *sig_len
// and *len hold the capacity on entry and the length written, or needed with
// TEE_ERROR_SHORT_BUFFER. The caller keeps its buffers. Each defaults to a
// panic, for an engine that does not offer it.
class AsymmetricEngine : public Engine {
  public:
    virtual TEE_Result encrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src,
                               size_t src_len, uint8_t *dst, uint32_t *dst_len);
    virtual TEE_Result decrypt(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *src,
                               size_t src_len, uint8_t *dst, uint32_t *dst_len);
    virtual TEE_Result sign_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                                   size_t digest_len, uint8_t *sig, uint32_t *sig_len);
    virtual TEE_Result verify_digest(Operation &op, const TEE_Attribute *params, uint32_t count, const uint8_t *digest,
                                     size_t digest_len, const uint8_t *sig, size_t sig_len);
    virtual TEE_Result export_key(Operation &op, uint32_t selector, uint8_t *out, uint32_t *len);
};

} // namespace tee_host::detail

#endif
