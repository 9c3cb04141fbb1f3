/*
 * rsa.h - RSA keys and operations. Key data: u32 key size in bits, then
 * n, e, d, p, q, dp, dq, qinv, each as u32 length + unsigned big-endian
 * bytes. Import material is the same without the key size.
 */
#ifndef RSA_H
#define RSA_H

#include "algorithm_provider.h"

constexpr uint32_t kRsaMaxKeyBits = 8192;
constexpr uint32_t kRsaComponents = 8;

/*
 * rsa_generate_key / rsa_import_key - the provider's key slots: the
 * parameters are checked and completed (origin, key size, exponent), the
 * key data returned in a buffer the caller frees. Refusals set *error.
 */
generate_key_fn rsa_generate_key;
import_key_fn rsa_import_key;
/* rsa_export_key - the DER SubjectPublicKeyInfo into out; every failure is *error -1000. */
export_key_fn rsa_export_key;
/*
 * rsa_resolve_key_data - a TEE RSA key-pair object from key data. The
 * attributes point into key_data while the object is populated. On
 * success *object is a new object the caller frees.
 */
resolve_key_data_fn rsa_resolve_key_data;

/*
 * rsa_operation_t - what every RSA record holds: the RSA operation, the
 * key object, a buffer of one block (key size / 8 bytes: the unhashed
 * message, the final digest or the input to encrypt or decrypt) and how
 * much of it is used, and the begin parameters.
 */
struct rsa_operation_t : keyed_record_t {
    uint8_t *block;
    uint32_t block_len;
    uint32_t digest;
    uint32_t padding;
    uint32_t key_size;
};

/*
 * rsa_sign_operation_t / rsa_verify_operation_t - one layout for both: the
 * digest operation (none for unhashed signatures) and the SOTER
 * raw-message buffer of signing records.
 */
struct rsa_signature_operation_t : rsa_operation_t {
    TEE_OperationHandle digest_operation;
    uint8_t *soter_buf;
    uint32_t soter_capacity;
    uint32_t soter_len;
};
using rsa_sign_operation_t = rsa_signature_operation_t;
using rsa_verify_operation_t = rsa_signature_operation_t;

/* rsa_encrypt_operation_t / rsa_decrypt_operation_t - the whole input, one block at most. */
struct rsa_cipher_operation_t : rsa_operation_t {};
using rsa_encrypt_operation_t = rsa_cipher_operation_t;
using rsa_decrypt_operation_t = rsa_cipher_operation_t;

/*
 * Shared cores of the twin files.
 *
 * rsa_signature_create / rsa_cipher_create - a record of fns's kind for
 * the begin parameters: key object, one-block buffer, TEE operation (and
 * digest operation). Null on failure, with *error set where the caller
 * is at fault; a TEE failure sets none.
 */
operation_t *rsa_signature_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  bool signing, int32_t *error, const operation_fns_t *fns, const char *func);
operation_t *rsa_cipher_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                               uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func);
/* rsa_signature_buffer - feeds the digest, or buffers unhashed input up to its limit (-21 past it). */
TEE_Result rsa_signature_buffer(rsa_signature_operation_t *op, const uint8_t *input, uint32_t *input_len,
                                int32_t *error, const char *verb, const char *func);
/*
 * rsa_signature_message - the value both finishes work on, in the message
 * buffer: the digest finished there (its failure logged in func's name
 * and returned), or without a digest the buffered message made into the
 * k-byte block (zero-padded for raw RSA, 00 01 FF..FF 00 M for PKCS#1).
 */
TEE_Result rsa_signature_message(rsa_signature_operation_t *op, const char *func);
/*
 * rsa_operation_release - the release slot of the encrypt and decrypt
 * tables: key object, RSA operation and block buffer, each required of a
 * complete record. rsa_signature_release adds the signature twins' digest
 * operation and SOTER buffer, both optional.
 */
release_fn rsa_operation_release;
release_fn rsa_signature_release;

/* rsa_cipher_update - buffers input up to one block (-21 past it); nothing is output. */
TEE_Result rsa_cipher_update(operation_t *op, const uint8_t *input, uint32_t *input_len, uint32_t *output_len,
                             int32_t *error, const char *verb, const char *func);

/*
 * rsa_output_alloc - the key-size output buffer of a finish; false, with
 * "Out of memory" logged in the caller's name and *error -41, when the
 * heap is exhausted.
 */
bool rsa_output_alloc(heap_buf *out, uint32_t key_size, int32_t *error, const char *func = __builtin_FUNCTION());

/* The raw RSA calls of the finishes, each with its own failure text. */
enum class rsa_raw_call : uint8_t { encrypt, decrypt, sign };

/*
 * rsa_raw - runs one raw RSA call of op's operation over in into out
 * (capacity key size / 8; *out_len the bytes written, which for raw
 * results come without leading zeros). An input the key cannot take (TEE_ERROR_BAD_PARAMETERS) is
 * *error -38 with TEE_SUCCESS and no log; any other failure is logged
 * in the caller's name and returned.
 */
TEE_Result rsa_raw(rsa_operation_t *op, rsa_raw_call call, const uint8_t *in, uint32_t in_len, uint8_t *out,
                   uint32_t *out_len, int32_t *error, const char *func = __builtin_FUNCTION());

/*
 * rsa_left_pad - a raw RSA result of *len bytes in a buffer of key_size/8
 * bytes, which come back without leading zeros, regains them: *len becomes
 * key_size/8.
 */
void rsa_left_pad(uint8_t *out, uint32_t *len, uint32_t key_size);

/*
 * rsa_salt_attribute - the attributes of a signature call: for PSS one
 * TEE_ATTR_RSA_PSS_SALT_LENGTH with a = salt in *attr, and the count 1;
 * for any other padding none, and 0.
 */
inline uint32_t rsa_salt_attribute(uint32_t padding, uint32_t salt, TEE_Attribute *attr) {
    if (padding != KM_PAD_RSA_PSS)
        return 0;
    TEE_InitValueAttribute(attr, TEE_ATTR_RSA_PSS_SALT_LENGTH, salt, 0);
    return 1;
}

/* The digest's length in bytes (KM_DIGEST_MD5..SHA_2_512), 0 otherwise. */
uint32_t rsa_digest_length(uint32_t digest);

/* create_rsa_sign, create_rsa_verify, create_rsa_encrypt, create_rsa_decrypt - the create slots of the four tables. */
create_operation_fn create_rsa_sign, create_rsa_verify, create_rsa_encrypt, create_rsa_decrypt;

#endif
