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

/*
 * begin - command 16: opens the blob, authorizes the use, builds the
 * operation and parks it. Success: *handle the new handle, out the
 * serialized output parameters (*out_len their length), *error 0. A
 * refusal is TEE_SUCCESS with *error set; a malformed request a TEE
 * result. Nothing is kept on failure.
 */
TEE_Result begin(uint32_t purpose, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error,
                 uint32_t *handle);
/*
 * update - command 17: feeds data to the operation of handle; *consumed
 * the input taken, out and *out_len what the operation wrote. Any failure
 * after the handle was found ends the operation.
 */
TEE_Result update(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error,
                  uint32_t *consumed);
/*
 * finish - command 18: the operation's output and output parameters into
 * out (u32 length + output, u32 length + parameters). Always ends the
 * operation once its handle was found.
 */
TEE_Result finish(uint32_t handle, const uint8_t *in, uint32_t in_len, uint8_t *out, uint32_t *out_len, int32_t *error);
/* abort_operation - command 23 ("_abort"): ends the operation of handle; *error -28 when there is none. */
TEE_Result abort_operation(uint32_t handle, int32_t *error);

#endif
