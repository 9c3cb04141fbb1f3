/*
 * ec_der.h - ECDSA signatures between the TEE's fixed-width r || s and
 * the DER ECDSA-Sig-Value (a SEQUENCE of two INTEGERs, r then s) that
 * callers exchange. Only canonical DER passes the decoder.
 */
#ifndef EC_DER_H
#define EC_DER_H

#include <cstdint>

#include <tee_internal_api.h>

#include "byte_io.h"

/*
 * encode_length - writes the DER length field of len through w: one byte
 * up to 127, else 0x80 | n and the n bytes of len, most significant first.
 * False (logged) when w has no room.
 */
bool encode_length(byte_writer *w, uint32_t len);

/* der_length_size - the bytes encode_length writes for len. */
uint32_t der_length_size(uint32_t len);

/*
 * der_encode_ec_signature - the DER form of the unsigned big-endian r and
 * s (leading zeros dropped, a sign byte added where the top bit is set).
 * A new heap buffer the caller frees, its length in *out_len if given;
 * null (logged) when out of memory.
 */
uint8_t *der_encode_ec_signature(const uint8_t *r, uint32_t r_len, const uint8_t *s, uint32_t s_len, uint32_t *out_len);

/*
 * der_decode_ec_signature - r and s of a DER signature, each right-aligned
 * and zero-filled in its buffer. TEE_SUCCESS only for input that
 * der_encode_ec_signature would write again byte for byte; any other
 * input is TEE_ERROR_GENERIC (logged), an encoder out of memory
 * TEE_ERROR_OUT_OF_MEMORY. Never reads beyond der_len bytes.
 */
TEE_Result der_decode_ec_signature(const uint8_t *der, uint32_t der_len, uint8_t *r, uint32_t r_size, uint8_t *s,
                                   uint32_t s_size);

#endif
