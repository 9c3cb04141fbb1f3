/*
 * ta_heap.h - the TA's allocation wrappers and RAII guards.
 *
 * Every heap byte of the TA comes from TEE_Malloc through these wrappers,
 * zero-filled, with the caller's file and line recorded by the platform.
 */
#ifndef TA_HEAP_H
#define TA_HEAP_H

#include <cstdint>
#include <utility>

#include <tee_internal_api.h>

#include "ta_log.h"

/*
 * ta_malloc - allocates size zero-filled bytes; a non-null pointer even for
 * 0 bytes. Returns null when the heap is exhausted. The caller owns the
 * block and releases it with ta_free.
 */
inline void *ta_malloc(uint32_t size, const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
    return TEE_MallocAt(size, TEE_MALLOC_FILL_ZERO, file, line);
}

/*
 * ta_malloc_logged - ta_malloc that, when the heap is exhausted, logs "Out
 * of memory, need %dB" in the caller's name before returning null.
 */
inline void *ta_malloc_logged(uint32_t size, const char *func = __builtin_FUNCTION(),
                              const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
    void *p = ta_malloc(size, file, line);
    if (!p)
        KM_TRACE_AT(TEE_TRACE_ERROR, func, line, "Out of memory, need %dB", static_cast<int>(size));
    return p;
}

/* ta_new - a zero-filled T from ta_malloc_logged; null (logged) when the heap is exhausted. */
template <typename T>
T *ta_new(const char *func = __builtin_FUNCTION(), const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
    return static_cast<T *>(ta_malloc_logged(sizeof(T), func, file, line));
}

/*
 * ta_realloc - resizes a block. On failure returns null and the old block
 * stays valid and owned by the caller.
 */
inline void *ta_realloc(void *p, uint32_t size, const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
    return TEE_ReallocAt(p, size, file, line);
}

/* ta_free - releases a block; null is ignored. */
inline void ta_free(void *p) {
    TEE_Free(p);
}

/* ta_free_wiped - wipes len bytes of a block holding secrets, then frees it. */
inline void ta_free_wiped(void *p, uint32_t len) {
    if (p) {
        TEE_MemFill(p, 0, len);
        TEE_Free(p);
    }
}

/*
 * heap_buf - owns one heap block and its length; frees it (wiped when it
 * is marked secret) when the guard goes out of scope.
 */
class heap_buf {
  public:
    heap_buf() = default;
    explicit heap_buf(bool secret) : secret_(secret) {}
    ~heap_buf() { reset(); }
    heap_buf(const heap_buf &) = delete;
    heap_buf &operator=(const heap_buf &) = delete;

    /* alloc - replaces the block with a new one of len bytes; false when out of memory. */
    bool alloc(uint32_t len, const char *file = __builtin_FILE(), int line = __builtin_LINE()) {
        reset();
        p_ = static_cast<uint8_t *>(ta_malloc(len, file, line));
        len_ = p_ ? len : 0;
        return p_ != nullptr;
    }
    /* adopt - takes ownership of a block the caller allocated with ta_malloc. */
    void adopt(void *p, uint32_t len) {
        reset();
        p_ = static_cast<uint8_t *>(p);
        len_ = len;
    }
    /* release - gives up ownership; the caller frees the block. */
    uint8_t *release() {
        uint8_t *p = p_;
        p_ = nullptr;
        len_ = 0;
        return p;
    }
    void reset() {
        if (secret_)
            ta_free_wiped(p_, len_);
        else
            ta_free(p_);
        p_ = nullptr;
        len_ = 0;
    }
    void set_len(uint32_t len) { len_ = len; }
    uint8_t *get() const { return p_; }
    uint32_t len() const { return len_; }
    explicit operator bool() const { return p_ != nullptr; }

  private:
    uint8_t *p_ = nullptr;
    uint32_t len_ = 0;
    bool secret_ = false;
};

/* scope_exit - runs a cleanup when the scope ends, unless dismissed. */
template <typename F> class scope_exit {
  public:
    explicit scope_exit(F f) : f_(std::move(f)) {}
    ~scope_exit() {
        if (armed_)
            f_();
    }
    scope_exit(const scope_exit &) = delete;
    scope_exit &operator=(const scope_exit &) = delete;
    void dismiss() { armed_ = false; }

  private:
    F f_;
    bool armed_ = true;
};

#endif
