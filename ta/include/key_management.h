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

TEE_Result generate_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
TEE_Result import_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
TEE_Result get_key_character_size(const uint8_t *in, uint32_t in_len, int32_t *error, uint32_t *size);
TEE_Result get_key_character(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
TEE_Result export_key(const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
TEE_Result delete_key(const uint8_t *in, uint32_t in_len, int32_t *error);
TEE_Result delete_all_key(int32_t *error);

#endif
