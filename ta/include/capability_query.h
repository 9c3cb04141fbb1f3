/*
 * capability_query.h - commands 1 to 12: what the TA supports, asked
 * without a key. Count commands set *error and *count; list commands fill
 * out, whose size must be exactly 4 x count, and never change its size.
 */
#ifndef CAPABILITY_QUERY_H
#define CAPABILITY_QUERY_H

#include <cstdint>

#include <tee_internal_api.h>

TEE_Result get_support_algo_cnt(uint32_t *count);
TEE_Result get_support_algo(uint8_t *out, uint32_t out_size);

TEE_Result get_support_blk_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_blk_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size,
                                int32_t *error);
TEE_Result get_support_padding_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_padding_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size,
                                    int32_t *error);
TEE_Result get_support_digest_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_digest(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size,
                              int32_t *error);

TEE_Result get_support_import_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count);
TEE_Result get_support_import_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error);
TEE_Result get_support_export_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count);
TEE_Result get_support_export_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error);

#endif
