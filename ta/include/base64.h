/*
 * base64.h - RFC 4648 base64 (standard alphabet, padded, one line) and the
 * PEM wrapping of a DER public key.
 */
#ifndef BASE64_H
#define BASE64_H

#include <cstdint>

#include <tee_internal_api.h>

/*
 * base64_encode - a new NUL-terminated encoding of length bytes, with no
 * line breaks; the empty string for no bytes. Null when data is missing or
 * memory is short. The caller frees it with ta_free.
 */
char *base64_encode(const uint8_t *data, uint32_t length);

/*
 * base64_decode - decodes a NUL-terminated text, skipping every character
 * outside the alphabet ('=', whitespace, line breaks). Returns the count
 * of bytes in *out, a new buffer the caller frees with ta_free; 0 (and
 * *out null) on failure or when nothing decodes.
 */
uint32_t base64_decode(const char *text, uint8_t **out);

/*
 * public_key_to_pem - "-----BEGIN PUBLIC KEY-----\n", the base64 of the DER
 * on one line, "\n-----END PUBLIC KEY-----" and a NUL, written to dest.
 * *out_len is the length counting the NUL. dest may be the buffer holding
 * the DER. TEE_ERROR_OUT_OF_MEMORY when encoding fails, TEE_ERROR_SHORT_BUFFER
 * (nothing written) when the text exceeds capacity.
 */
TEE_Result public_key_to_pem(const uint8_t *der, uint32_t der_len, uint8_t *dest, uint32_t capacity, uint32_t *out_len);

#endif
