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

TEE_Result rsa_generate_key(keymaster_key_param_set_t *params, uint8_t **key_data, uint32_t *key_data_len,
                            int32_t *error);
TEE_Result rsa_import_key(keymaster_key_param_set_t *params, const uint8_t *material, uint32_t material_len,
                          uint8_t **key_data, uint32_t *key_data_len, int32_t *error);
/* rsa_export_key - the DER SubjectPublicKeyInfo into out; every failure is *error -1000. */
TEE_Result rsa_export_key(const uint8_t *key_data, uint32_t key_data_len, uint8_t *out, uint32_t *out_len,
                          int32_t *error);
/*
 * rsa_resolve_key_data - a TEE RSA key-pair object from key data. The
 * attributes point into key_data while the object is populated. On
 * success *object is a new object the caller frees.
 */
TEE_Result rsa_resolve_key_data(const uint8_t *key_data, uint32_t key_data_len, TEE_ObjectHandle *object,
                                uint32_t *key_size, int32_t *error);

/*
 * rsa_sign_operation_t / rsa_verify_operation_t - one layout for both: the
 * RSA operation, the digest operation (none for unhashed signatures), the
 * key, the message buffer (key size / 8 bytes: the unhashed message or the
 * final digest), and the SOTER raw-message buffer of signing records.
 */
struct rsa_signature_operation_t {
    operation_t header;
    TEE_OperationHandle operation;
    TEE_OperationHandle digest_operation;
    TEE_ObjectHandle key;
    uint8_t *message;
    uint32_t message_len;
    uint32_t digest;
    uint32_t padding;
    uint32_t key_size;
    uint8_t *soter_buf;
    uint32_t soter_capacity;
    uint32_t soter_len;
};
using rsa_sign_operation_t = rsa_signature_operation_t;
using rsa_verify_operation_t = rsa_signature_operation_t;

/* rsa_encrypt_operation_t / rsa_decrypt_operation_t - the whole input, one block at most. */
struct rsa_cipher_operation_t {
    operation_t header;
    TEE_OperationHandle operation;
    TEE_ObjectHandle key;
    uint8_t *input;
    uint32_t input_len;
    uint32_t digest;
    uint32_t padding;
    uint32_t key_size;
};
using rsa_encrypt_operation_t = rsa_cipher_operation_t;
using rsa_decrypt_operation_t = rsa_cipher_operation_t;

/* Shared cores of the twin files. */
operation_t *rsa_signature_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                  bool signing, int32_t *error, const operation_fns_t *fns, const char *func);
TEE_Result rsa_signature_buffer(rsa_signature_operation_t *op, const uint8_t *input, uint32_t *input_len,
                                int32_t *error, const char *verb, const char *func);
/* rsa_signature_digest - finishes the digest into the message buffer. */
TEE_Result rsa_signature_digest(rsa_signature_operation_t *op, const char *func);
/* rsa_signature_block - turns the buffered message into the k-byte block signed without a digest. */
void rsa_signature_block(rsa_signature_operation_t *op);
void rsa_signature_free(operation_t *op, const char *record_name, bool soter, const char *func);

operation_t *rsa_cipher_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                               uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func);
TEE_Result rsa_cipher_update(operation_t *op, const uint8_t *input, uint32_t *input_len, uint32_t *output_len,
                             int32_t *error, const char *verb, const char *func);
void rsa_cipher_free(operation_t *op, const char *record_name, const char *func);

/* The digest's length in bytes (KM_DIGEST_MD5..SHA_2_512), 0 otherwise. */
uint32_t rsa_digest_length(uint32_t digest);

operation_t *create_rsa_sign(const uint8_t *, uint32_t, keymaster_key_param_set_t *, keymaster_key_param_set_t *,
                             keymaster_key_param_set_t *, int32_t *);
operation_t *create_rsa_verify(const uint8_t *, uint32_t, keymaster_key_param_set_t *, keymaster_key_param_set_t *,
                               keymaster_key_param_set_t *, int32_t *);
operation_t *create_rsa_encrypt(const uint8_t *, uint32_t, keymaster_key_param_set_t *, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *, int32_t *);
operation_t *create_rsa_decrypt(const uint8_t *, uint32_t, keymaster_key_param_set_t *, keymaster_key_param_set_t *,
                                keymaster_key_param_set_t *, int32_t *);

#endif
