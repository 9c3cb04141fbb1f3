/*
 * tee_guard.h - RAII guards for TEE objects and operations, so that every
 * path of a handler releases what it allocated.
 */
#ifndef TEE_GUARD_H
#define TEE_GUARD_H

#include <tee_internal_api.h>

#include "ta_log.h"

/*
 * free_handle - releases *h with Release when it is set and clears it:
 * for handles kept outside a guard. free_object and free_operation are
 * the two kinds.
 */
template <typename Handle, void (*Release)(Handle)> void free_handle(Handle *h) {
    if (*h)
        Release(*h);
    *h = nullptr;
}
inline void free_object(TEE_ObjectHandle *h) {
    free_handle<TEE_ObjectHandle, TEE_FreeTransientObject>(h);
}
inline void free_operation(TEE_OperationHandle *h) {
    free_handle<TEE_OperationHandle, TEE_FreeOperation>(h);
}

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
    void reset() { free_handle<Handle, Release>(&h_); }

  private:
    Handle h_ = nullptr;
};

/* object_guard - a transient object, freed. */
using object_guard = tee_handle_guard<TEE_ObjectHandle, TEE_FreeTransientObject>;
/* persistent_guard - an open persistent object, closed. */
using persistent_guard = tee_handle_guard<TEE_ObjectHandle, TEE_CloseObject>;
/* operation_guard - an operation, freed. */
using operation_guard = tee_handle_guard<TEE_OperationHandle, TEE_FreeOperation>;

/* Which log text keyed_operation and key_object use for a failed TEE call X. */
enum class tee_call_texts : uint8_t {
    standard, // "X failed with 0x%08x\n"
    prefixed, // "TEE_X failed: %08x\n"
};

/* tee_call_failed - logs the failure of the TEE call named `call` in the texts' form. */
inline void tee_call_failed(tee_call_texts texts, const char *call, TEE_Result res, const char *func, int line) {
    if (texts == tee_call_texts::prefixed)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "TEE_%s failed: %08x\n", call, res);
    else
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "%s failed with 0x%08x\n", call, res);
}

/*
 * tee_logged - res as it is, logged by tee_call_failed when it is a
 * failure: for a TEE call whose result is the caller's answer.
 */
inline TEE_Result tee_logged(TEE_Result res, const char *call, tee_call_texts texts,
                             const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    if (res != TEE_SUCCESS)
        tee_call_failed(texts, call, res, func, line);
    return res;
}

/* How key_object fills its new object. */
enum class key_fill : uint8_t {
    populate, // with the given attributes (TEE_PopulateTransientObject)
    generate, // with a fresh key, the attributes as generation parameters (TEE_GenerateKey)
};

/*
 * key_object - a transient object of type and bits, filled as `fill`
 * says. TEE_SUCCESS with *object owned by the caller; on failure *object
 * is null, the failing call is logged in the caller's name and its result
 * returned.
 */
inline TEE_Result key_object(uint32_t type, uint32_t bits, const TEE_Attribute *attrs, uint32_t count,
                             TEE_ObjectHandle *object, key_fill fill = key_fill::populate,
                             tee_call_texts texts = tee_call_texts::standard, const char *func = __builtin_FUNCTION(),
                             int line = __builtin_LINE()) {
    *object = nullptr;
    object_guard obj;
    TEE_Result res = TEE_AllocateTransientObject(type, bits, obj.out());
    if (res != TEE_SUCCESS) {
        tee_call_failed(texts, "AllocateTransientObject", res, func, line);
        return res;
    }
    const bool generate = fill == key_fill::generate;
    res = generate ? TEE_GenerateKey(obj.get(), bits, attrs, count)
                   : TEE_PopulateTransientObject(obj.get(), attrs, count);
    if (res != TEE_SUCCESS) {
        tee_call_failed(texts, generate ? "GenerateKey" : "PopulateTransientObject", res, func, line);
        return res;
    }
    *object = obj.release();
    return TEE_SUCCESS;
}

/* secret_key_object - key_object with one TEE_ATTR_SECRET_VALUE of bits / 8 bytes of key. */
inline TEE_Result secret_key_object(uint32_t type, uint32_t bits, const uint8_t *key, TEE_ObjectHandle *object,
                                    const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    TEE_Attribute attr{};
    TEE_InitRefAttribute(&attr, TEE_ATTR_SECRET_VALUE, key, bits / 8);
    return key_object(type, bits, &attr, 1, object, key_fill::populate, tee_call_texts::standard, func, line);
}

/*
 * keyed_operation - allocates a TEE operation (algorithm, mode, maximum key
 * size) and sets key on it; with key null (a digest) no key is set. TEE_SUCCESS with *op owned by the caller; on
 * failure *op is null, the failing call is logged in the caller's name and
 * its result returned.
 */
inline TEE_Result keyed_operation(TEE_OperationHandle *op, uint32_t algorithm, uint32_t mode, uint32_t max_key_size,
                                  TEE_ObjectHandle key, tee_call_texts texts = tee_call_texts::standard,
                                  const char *func = __builtin_FUNCTION(), int line = __builtin_LINE()) {
    TEE_OperationHandle h = nullptr;
    *op = nullptr;
    TEE_Result res = TEE_AllocateOperation(&h, algorithm, mode, max_key_size);
    if (res != TEE_SUCCESS) {
        tee_call_failed(texts, "AllocateOperation", res, func, line);
        return res;
    }
    res = key ? TEE_SetOperationKey(h, key) : TEE_SUCCESS;
    if (res != TEE_SUCCESS) {
        tee_call_failed(texts, "SetOperationKey", res, func, line);
        TEE_FreeOperation(h);
        return res;
    }
    *op = h;
    return TEE_SUCCESS;
}

#endif
