/*
 * capability_query.h - commands 1 to 12: what the TA supports, asked
 * without a key. Count commands set *error and *count; list commands fill
 * out, whose size must be exactly 4 x count, and never change its size.
 */
#ifndef CAPABILITY_QUERY_H
#define CAPABILITY_QUERY_H

#include <cstdint>

#include <tee_internal_api.h>

/* get_support_algo_cnt - *count the number of providers; always TEE_SUCCESS. */
TEE_Result get_support_algo_cnt(uint32_t *count);
/*
 * get_support_algo - the providers' algorithm values in table order;
 * TEE_ERROR_SHORT_BUFFER unless out_size is exactly 4 x count.
 */
TEE_Result get_support_algo(uint8_t *out, uint32_t out_size);

/*
 * get_support_blk_mode_cnt / _padding_mode_cnt / _digest_cnt - the size of
 * the purpose table's list: *error -4 for an unknown algorithm, -2 for a
 * purpose it lacks. The list commands write the values into out, with the
 * same refusals and TEE_ERROR_SHORT_BUFFER for a size other than 4 x count.
 */
TEE_Result get_support_blk_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_blk_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size, int32_t *error);
TEE_Result get_support_padding_mode_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_padding_mode(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size,
                                    int32_t *error);
TEE_Result get_support_digest_cnt(uint32_t algorithm, uint32_t purpose, int32_t *error, uint32_t *count);
TEE_Result get_support_digest(uint32_t algorithm, uint32_t purpose, uint8_t *out, uint32_t out_size, int32_t *error);

/* The key-format lists of a provider, by the same protocol; *error -4 for an unknown algorithm. */
TEE_Result get_support_import_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count);
TEE_Result get_support_import_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error);
TEE_Result get_support_export_format_cnt(uint32_t algorithm, int32_t *error, uint32_t *count);
TEE_Result get_support_export_format(uint32_t algorithm, uint8_t *out, uint32_t out_size, int32_t *error);

#endif
