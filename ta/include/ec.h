/*
 * ec.h - EC keys on the NIST prime curves and ECDSA operations. Key data:
 * u32 key size in bits (it selects the curve), then x, y and the private
 * value d, each as u32 length + unsigned big-endian bytes. Import material
 * is the same layout; export is the key size, x and y.
 */
#ifndef EC_H
#define EC_H

#include "algorithm_provider.h"

/* ec_field_bytes - the bytes of a coordinate and of each signature half: 66 on P-521. */
constexpr uint32_t ec_field_bytes(uint32_t key_size) {
    return (key_size + 7) / 8;
}

/*
 * ec_generate_key / ec_import_key - the provider's key slots: the
 * parameters are checked and completed (origin, key size), the key data
 * returned in a buffer the caller frees. Refusals set *error.
 */
generate_key_fn ec_generate_key;
import_key_fn ec_import_key;
/*
 * ec_export_key - the key size, x and y of the key data, with their length
 * words, into out (capacity *out_len; *out_len the bytes written). Always
 * TEE_SUCCESS; key data or room cut short is *error -1000 and *out_len 0.
 */
export_key_fn ec_export_key;
/*
 * ec_resolve_key_data - a TEE ECDSA key-pair object from key data; the
 * attributes point into key_data while the object is populated. On
 * success *object is a new object the caller frees and *key_size (if
 * given) its bits. A key size of no supported curve is *error -6 with
 * TEE_SUCCESS and no object; TEE failures are returned.
 */
resolve_key_data_fn ec_resolve_key_data;

/*
 * ec_operation_t - the record of an ECDSA signing or verifying operation
 * (one layout for both): the ECDSA operation and its key, the digest
 * operation (none for KM_DIGEST_NONE), and the message buffer: the digest
 * (message_len is its room) or, unhashed, up to one field of input
 * (message_len is what is buffered).
 */
struct ec_operation_t : keyed_record_t {
    TEE_OperationHandle digest_operation;
    uint8_t *message;
    uint32_t message_len;
    uint32_t digest;
    uint32_t key_size;
};
using ec_sign_operation_t = ec_operation_t;
using ec_verify_operation_t = ec_operation_t;

/*
 * Shared cores of the twin files.
 *
 * ec_operation_create - a record of fns's kind for the begin parameters:
 * key object, digest operation, message buffer and the keyed ECDSA
 * operation in mode. Null on failure, logged in the caller's name, with
 * *error set where the request is at fault; a TEE failure sets none.
 */
operation_t *ec_operation_create(const uint8_t *key_data, uint32_t key_data_len, keymaster_key_param_set_t *in_params,
                                 uint32_t mode, int32_t *error, const operation_fns_t *fns, const char *func);
/*
 * ec_operation_update - the update slot of both tables: feeds the digest, or buffers unhashed input up to
 * one field: what does not fit is reported as not consumed. Nothing is
 * output. Always TEE_SUCCESS.
 */
update_fn ec_operation_update;
/*
 * ec_operation_message - the value to sign or verify: the digest finished
 * into the message buffer (its failure logged in the caller's name and
 * returned), then cut to the key's leftmost bits; *len its length.
 */
TEE_Result ec_operation_message(ec_operation_t *op, uint32_t *len, const char *func);
/*
 * ec_truncate_digest - keeps the leftmost key_size bits of the len-byte
 * big-endian value in buf, in place, as ECDSA takes a digest; returns the
 * new length. Values no longer than the key pass unchanged.
 */
uint32_t ec_truncate_digest(uint8_t *buf, uint32_t len, uint32_t key_size);
/*
 * ec_operation_release - the release slot of both tables: key object,
 * ECDSA operation and message buffer, each required of a complete record,
 * and the optional digest operation.
 */
release_fn ec_operation_release;

/* create_ec_sign, create_ec_verify - the create slots of the two tables. */
create_operation_fn create_ec_sign, create_ec_verify;

#endif
