/*
 * tee_guard.h - RAII guards for TEE objects and operations, so that every
 * path of a handler releases what it allocated.
 */
#ifndef TEE_GUARD_H
#define TEE_GUARD_H

#include <tee_internal_api.h>

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

#endif
