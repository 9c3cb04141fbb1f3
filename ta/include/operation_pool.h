/*
 * operation_pool.h - the 16 live operations and their random handles, and
 * the begin, update, finish and abort commands.
 */
#ifndef OPERATION_POOL_H
#define OPERATION_POOL_H

#include "algorithm_provider.h"

constexpr uint32_t kOperationSlots = 16;

/* operation_pool_init - marks every slot free; always TEE_SUCCESS. */
TEE_Result operation_pool_init();
/*
 * operation_pool_add - parks op under a fresh handle: random, nonzero and
 * unlike the handle of every slot. *error -31 with *handle 0 when full.
 */
TEE_Result operation_pool_add(operation_t *op, uint32_t *handle, int32_t *error);
/* operation_pool_get - the live operation of handle, or null. */
operation_t *operation_pool_get(uint32_t handle);
/* operation_pool_remove - frees the slot; the operation itself is the caller's. */
void operation_pool_remove(uint32_t handle);
/* operation_pool_end_all - ends every live operation (instance teardown). */
void operation_pool_end_all();

TEE_Result begin(uint32_t purpose, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                 int32_t *error, uint32_t *handle);
TEE_Result update(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                  int32_t *error, uint32_t *consumed);
TEE_Result finish(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len,
                  int32_t *error);
TEE_Result _abort(uint32_t handle, int32_t *error);

#endif
