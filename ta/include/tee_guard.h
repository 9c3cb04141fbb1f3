/*
 * tee_guard.h - RAII guards for TEE objects and operations, so that every
 * path of a handler releases what it allocated.
 */
#ifndef TEE_GUARD_H
#define TEE_GUARD_H

#include <tee_internal_api.h>

#include "ta_log.h"

/*
 * tee_handle_guard - owns one TEE handle and releases it with Release on
 * scope exit. out() hands the slot to an allocating call; release() gives
 * the handle up to the caller.
 */
template <typename Handle, void (*Release)(Handle)> class tee_handle_guard {
  public:
    tee_handle_guard() = default;
    ~tee_handle_guard() { reset(); }
    tee_handle_guard(const tee_handle_guard &) = delete;
    tee_handle_guard &operator=(const tee_handle_guard &) = delete;

    Handle *out() {
        reset();
        return &h_;
    }
    Handle get() const { return h_; }
    Handle release() {
        Handle h = h_;
        h_ = nullptr;
        return h;
    }
    void reset() {
        if (h_)
            Release(h_);
        h_ = nullptr;
    }

  private:
    Handle h_ = nullptr;
};

/* object_guard - a transient object, freed. */
using object_guard = tee_handle_guard<TEE_ObjectHandle, TEE_FreeTransientObject>;
/* persistent_guard - an open persistent object, closed. */
using persistent_guard = tee_handle_guard<TEE_ObjectHandle, TEE_CloseObject>;
/* operation_guard - an operation, freed. */
using operation_guard = tee_handle_guard<TEE_OperationHandle, TEE_FreeOperation>;

/*
 * secret_key_object - a transient object of type and bits holding the
 * key bytes as its TEE_ATTR_SECRET_VALUE. TEE_SUCCESS with *object owned
 * by the caller; otherwise the failing call is logged in the caller's
 * name and its result returned, with *object null.
 */
inline TEE_Result secret_key_object(uint32_t type, uint32_t bits, const uint8_t *key, TEE_ObjectHandle *object,
                                    const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    *object = nullptr;
    TEE_Attribute attr{};
    TEE_InitRefAttribute(&attr, TEE_ATTR_SECRET_VALUE, key, bits / 8);
    object_guard obj;
    TEE_Result res = TEE_AllocateTransientObject(type, bits, obj.out());
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "AllocateTransientObject failed with 0x%08x\n", res);
        return res;
    }
    res = TEE_PopulateTransientObject(obj.get(), &attr, 1);
    if (res != TEE_SUCCESS) {
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "PopulateTransientObject failed with 0x%08x\n", res);
        return res;
    }
    *object = obj.release();
    return TEE_SUCCESS;
}

/* Which log texts keyed_operation uses for its two TEE calls. */
enum class tee_call_texts : uint8_t {
    standard, // "AllocateOperation failed with 0x%08x\n", "SetOperationKey failed with 0x%08x\n"
    prefixed, // "TEE_AllocateOperation failed: %08x\n", "TEE_SetOperationKey failed: %08x\n"
};

/*
 * keyed_operation - allocates a TEE operation (algorithm, mode, maximum key
 * size) and sets key on it. TEE_SUCCESS with *op owned by the caller; on
 * failure *op is null, the failing call is logged in the caller's name and
 * its result returned.
 */
inline TEE_Result keyed_operation(TEE_OperationHandle *op, uint32_t algorithm, uint32_t mode, uint32_t max_key_size,
                                  TEE_ObjectHandle key, tee_call_texts texts = tee_call_texts::standard,
                                  const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    const bool prefixed = texts == tee_call_texts::prefixed;
    TEE_OperationHandle h = nullptr;
    *op = nullptr;
    TEE_Result res = TEE_AllocateOperation(&h, algorithm, mode, max_key_size);
    if (res != TEE_SUCCESS) {
        if (prefixed)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "TEE_AllocateOperation failed: %08x\n", res);
        else
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "AllocateOperation failed with 0x%08x\n", res);
        return res;
    }
    res = TEE_SetOperationKey(h, key);
    if (res != TEE_SUCCESS) {
        if (prefixed)
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "TEE_SetOperationKey failed: %08x\n", res);
        else
            KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "SetOperationKey failed with 0x%08x\n", res);
        TEE_FreeOperation(h);
        return res;
    }
    *op = h;
    return TEE_SUCCESS;
}

#endif
