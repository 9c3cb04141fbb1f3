/*
 * tee_guard.h - RAII guards for TEE objects and operations, so that every
 * path of a handler releases what it allocated.
 */
#ifndef TEE_GUARD_H
#define TEE_GUARD_H

#include <tee_internal_api.h>

/* object_guard - owns a transient object handle; frees it on scope exit. */
class object_guard {
public:
    object_guard() = default;
    ~object_guard() { reset(); }
    object_guard(const object_guard &) = delete;
    object_guard &operator=(const object_guard &) = delete;

    TEE_ObjectHandle *out() {
        reset();
        return &h_;
    }
    TEE_ObjectHandle get() const { return h_; }
    /* release - gives up ownership. */
    TEE_ObjectHandle release() {
        TEE_ObjectHandle h = h_;
        h_ = nullptr;
        return h;
    }
    void reset() {
        if (h_)
            TEE_FreeTransientObject(h_);
        h_ = nullptr;
    }

private:
    TEE_ObjectHandle h_ = nullptr;
};

/* persistent_guard - owns an open persistent object; closes it on scope exit. */
class persistent_guard {
public:
    persistent_guard() = default;
    ~persistent_guard() { close(); }
    persistent_guard(const persistent_guard &) = delete;
    persistent_guard &operator=(const persistent_guard &) = delete;

    TEE_ObjectHandle *out() {
        close();
        return &h_;
    }
    TEE_ObjectHandle get() const { return h_; }
    TEE_ObjectHandle release() {
        TEE_ObjectHandle h = h_;
        h_ = nullptr;
        return h;
    }
    void close() {
        if (h_)
            TEE_CloseObject(h_);
        h_ = nullptr;
    }

private:
    TEE_ObjectHandle h_ = nullptr;
};

/* operation_guard - owns an operation handle; frees it on scope exit. */
class operation_guard {
public:
    operation_guard() = default;
    ~operation_guard() { reset(); }
    operation_guard(const operation_guard &) = delete;
    operation_guard &operator=(const operation_guard &) = delete;

    TEE_OperationHandle *out() {
        reset();
        return &h_;
    }
    TEE_OperationHandle get() const { return h_; }
    TEE_OperationHandle release() {
        TEE_OperationHandle h = h_;
        h_ = nullptr;
        return h;
    }
    void reset() {
        if (h_)
            TEE_FreeOperation(h_);
        h_ = nullptr;
    }

private:
    TEE_OperationHandle h_ = nullptr;
};

#endif
