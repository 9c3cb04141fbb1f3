/*
 * marshal.h - the serialized form of a parameter set: u32 count, then
 * 24-byte records, each byte-string record followed at once by its data.
 */
#ifndef MARSHAL_H
#define MARSHAL_H

#include "byte_io.h"
#include "keymaster_defs.h"

/* is_hidden_param - application id, application data and root of trust: kept in blobs only. */
bool is_hidden_param(uint32_t tag);

/*
 * marshal_size - bytes of the serialized set, hidden parameters counted
 * only with include_hidden. Saturates at UINT32_MAX, which no buffer can
 * hold, so an absurd set fails to marshal instead of wrapping.
 */
uint32_t marshal_size(const keymaster_key_param_set_t *set, bool include_hidden);

/*
 * marshal - serializes set. With *buf null, allocates exactly the size
 * needed (the caller owns it and frees it with TEE_Free); otherwise *len is
 * the capacity of the caller's *buf. On success *len is the bytes written.
 * On failure *buf is null and *len 0 (an allocated buffer is freed, a
 * caller's buffer only forgotten).
 */
TEE_Result marshal(const keymaster_key_param_set_t *set, bool include_hidden, uint8_t **buf, uint32_t *len);

/*
 * marshal_lv - writes u32 length + the serialized set (hidden parameters
 * left out) at the writer's position, into what remains of its buffer.
 * *written (if given) is the set's length. A length word that does not fit
 * logs "Too short input" and fails with TEE_ERROR_GENERIC; a marshal
 * failure logs "Marshal failed" in the caller's name and returns its result.
 */
TEE_Result marshal_lv(byte_writer *w, const keymaster_key_param_set_t *set, uint32_t *written,
                      const char *func = __builtin_FUNCTION());

/*
 * unmarshal - parses in into set, which must be empty. On success set owns
 * its array and a fresh copy of every byte string; bytes after the last
 * record are ignored. On failure set is left empty and nothing is held.
 */
TEE_Result unmarshal(const uint8_t *in, uint32_t in_len, keymaster_key_param_set_t *set);

#endif
