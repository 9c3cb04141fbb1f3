/*
 * key_management.h - commands 13, 14, 15, 19, 20, 21 and 22: generate,
 * import, describe, export and delete keys. Each returns a TEE_Result for
 * malformed requests and internal faults and puts the Keymaster error in
 * *error; output buffers and sizes follow each command's response layout.
 */
#ifndef KEY_MANAGEMENT_H
#define KEY_MANAGEMENT_H

#include <cstdint>

#include <tee_internal_api.h>

/*
 * generate_key - command 13: the provider generates key data for the
 * serialized parameters in, sealed into the blob written to out. On
 * failure out is zero-filled over the capacity the caller gave and
 * *out_len is 0.
 */
TEE_Result generate_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
/*
 * import_key - command 19: u32 length + parameters, then the key material.
 * out receives u32 length + blob, u32 length + characteristics; on
 * failure it is zero-filled over its capacity.
 */
TEE_Result import_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
/* get_key_character_size - command 14: *size the bytes of the key's characteristics. */
TEE_Result get_key_character_size(const uint8_t *in, uint32_t in_len, int32_t *error, uint32_t *size);
/* get_key_character - command 15: the key's characteristics, hidden parameters left out, into out. */
TEE_Result get_key_character(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
/* export_key - command 20: the public key (or a SOTER key's signed document) into out. */
TEE_Result export_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
/* delete_key - command 21: nothing is stored per key; a blob under 2 bytes is refused with -33. */
TEE_Result delete_key(const uint8_t *in, uint32_t in_len, int32_t *error);
/* delete_all_key - command 22: always succeeds; no key is stored. */
TEE_Result delete_all_key(int32_t *error);

#endif
