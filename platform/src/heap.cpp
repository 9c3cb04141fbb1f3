/*
 * heap.cpp - the TA heap: zero-filled allocations counted against the TA's
 * data size, with failure injection and a record of where each live block
 * was allocated.
 */
#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <vector>

#include "platform_internal.h"

// Sanitizer builds poison each block's spare byte, so a one-byte overrun
// of a TA block is reported where it happens.
#if defined(__SANITIZE_ADDRESS__)
#define KM_HEAP_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define KM_HEAP_ASAN 1
#endif
#endif
#ifdef KM_HEAP_ASAN
#include <sanitizer/asan_interface.h>
#endif

namespace tee_host {
namespace {

// poison_spare, unpoison_spare - the byte after a block's size bytes.
void poison_spare([[maybe_unused]] void *p, [[maybe_unused]] size_t size) {
#ifdef KM_HEAP_ASAN
    ASAN_POISON_MEMORY_REGION(static_cast<char *>(p) + size, 1);
#endif
}
void unpoison_spare([[maybe_unused]] void *p, [[maybe_unused]] size_t size) {
#ifdef KM_HEAP_ASAN
    ASAN_UNPOISON_MEMORY_REGION(static_cast<char *>(p) + size, 1);
#endif
}

struct Block {
    const void *owner; // the TA whose call allocated it, null outside TA calls
    size_t size;
    const char *file;
    int line;
    uint64_t seq;
};

// BlockTable - the live blocks by address: open addressing with linear
// probing, so that recording a block costs no allocation of its own (a
// node-based map doubled the work of every TA allocation).
class BlockTable {
  public:
    size_t size() const { return live_; }

    Block *find(void *p) {
        if (slots_.empty())
            return nullptr;
        for (size_t i = index(p);; i = (i + 1) & mask()) {
            Slot &s = slots_[i];
            if (s.p == p)
                return &s.b;
            if (!s.p)
                return nullptr;
        }
    }

    void insert(void *p, const Block &b) {
        if ((used_ + 1) * 2 > slots_.size())
            rehash(live_ * 4 > slots_.size() ? slots_.size() * 2 : std::max<size_t>(slots_.size(), 1024));
        for (size_t i = index(p);; i = (i + 1) & mask()) {
            Slot &s = slots_[i];
            if (!s.p || s.p == tombstone()) {
                used_ += s.p ? 0 : 1;
                s = Slot{p, b};
                ++live_;
                return;
            }
        }
    }

    // erase - p must be present (find first).
    void erase(void *p) {
        for (size_t i = index(p);; i = (i + 1) & mask()) {
            if (slots_[i].p == p) {
                slots_[i].p = tombstone();
                --live_;
                return;
            }
        }
    }

    // for_each - f(p, block) for every live block; f returns whether to drop it.
    template <typename F> void for_each(F f) {
        for (Slot &s : slots_) {
            if (s.p && s.p != tombstone() && f(s.p, s.b)) {
                s.p = tombstone();
                --live_;
            }
        }
    }

    void clear() {
        slots_.clear();
        live_ = used_ = 0;
    }

  private:
    struct Slot {
        void *p = nullptr; // null: never used; tombstone(): freed
        Block b{};
    };
    static void *tombstone() { return reinterpret_cast<void *>(uintptr_t{1}); }
    size_t mask() const { return slots_.size() - 1; }
    size_t index(void *p) const {
        return static_cast<size_t>((reinterpret_cast<uintptr_t>(p) >> 4) * 0x9E3779B97F4A7C15ull) & mask();
    }
    void rehash(size_t capacity) {
        std::vector<Slot> old;
        old.swap(slots_);
        slots_.resize(capacity);
        live_ = used_ = 0;
        for (const Slot &s : old) {
            if (s.p && s.p != tombstone())
                insert(s.p, s.b);
        }
    }

    std::vector<Slot> slots_;
    size_t live_ = 0;
    size_t used_ = 0; // live blocks and tombstones
};

struct HeapState {
    std::mutex mu;
    BlockTable blocks;
    size_t live_bytes = 0;
    size_t peak_bytes = 0;
    size_t limit = 0x80000;
    uint64_t attempts = 0;
    uint64_t seq = 0;
    uint64_t fail_at = 0; // attempt number that fails, 0 = none
    bool fired = false;
    std::vector<heap::Allocation> last_leaks;
};

HeapState &state() {
    static HeapState s;
    return s;
}

// Decides under the lock whether this attempt fails by injection or lack of room.
bool refuse(HeapState &s, size_t old_size, size_t new_size) {
    ++s.attempts;
    if (s.fail_at != 0 && s.attempts == s.fail_at) {
        s.fail_at = 0;
        s.fired = true;
        return true;
    }
    return s.live_bytes - old_size + new_size > s.limit;
}

void *allocate(uint32_t size, uint32_t hint, const char *file, int line) {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    if (refuse(s, 0, size))
        return nullptr;
    // One spare byte keeps zero-sized blocks distinct and non-null.
    void *p = std::malloc(size_t{size} + 1);
    if (!p)
        return nullptr;
    if (hint == TEE_MALLOC_NO_FILL)
        std::memset(p, 0xA5, size_t{size} + 1); // make reliance on zeroes visible
    else
        std::memset(p, 0, size_t{size} + 1);
    poison_spare(p, size);
    s.blocks.insert(p, Block{detail::current_ta(), size, file ? file : "?", line, ++s.seq});
    s.live_bytes += size;
    if (s.live_bytes > s.peak_bytes)
        s.peak_bytes = s.live_bytes;
    return p;
}

void *reallocate(void *buffer, uint32_t new_size, const char *file, int line) {
    if (!buffer)
        return allocate(new_size, TEE_MALLOC_FILL_ZERO, file, line);
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    const Block *found = s.blocks.find(buffer);
    if (!found)
        detail::panic("TEE_Realloc of a pointer the heap did not hand out");
    const Block old = *found;
    if (refuse(s, old.size, new_size))
        return nullptr; // the old block stays valid
    void *p = std::malloc(size_t{new_size} + 1);
    if (!p)
        return nullptr;
    std::memset(p, 0, size_t{new_size} + 1);
    poison_spare(p, new_size);
    std::memcpy(p, buffer, old.size < new_size ? old.size : new_size);
    std::memset(buffer, 0, old.size); // old contents may be secret
    unpoison_spare(buffer, old.size);
    s.blocks.erase(buffer);
    std::free(buffer);
    s.blocks.insert(p, Block{old.owner, new_size, file ? file : old.file, file ? line : old.line, ++s.seq});
    s.live_bytes = s.live_bytes - old.size + new_size;
    if (s.live_bytes > s.peak_bytes)
        s.peak_bytes = s.live_bytes;
    return p;
}

std::vector<heap::Allocation> live_locked(HeapState &s) {
    std::vector<std::pair<uint64_t, heap::Allocation>> v;
    s.blocks.for_each([&](void *, const Block &b) {
        v.push_back({b.seq, heap::Allocation{b.size, b.file, b.line}});
        return false;
    });
    std::sort(v.begin(), v.end(), [](const auto &x, const auto &y) { return x.first < y.first; });
    std::vector<heap::Allocation> out;
    for (auto &e : v)
        out.push_back(std::move(e.second));
    return out;
}

} // namespace

namespace heap {
Stats stats() {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return Stats{s.blocks.size(), s.live_bytes, s.peak_bytes, s.attempts, s.limit};
}

std::vector<Allocation> live() {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return live_locked(s);
}

void fail_nth(uint64_t n) {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    s.fail_at = n == 0 ? 0 : s.attempts + n;
    s.fired = false;
}

bool injected_failure_fired() {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return s.fired;
}

std::vector<Allocation> leaks_at_last_destroy() {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    return s.last_leaks;
}
} // namespace heap

namespace detail {
void heap_reset(size_t limit) {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    s.blocks.for_each([](void *p, const Block &b) {
        std::memset(p, 0, b.size);
        unpoison_spare(p, b.size);
        std::free(p);
        return true;
    });
    s.blocks.clear();
    s.live_bytes = 0;
    s.peak_bytes = 0;
    s.limit = limit;
    s.attempts = 0;
    s.fail_at = 0;
    s.fired = false;
    s.last_leaks.clear();
}

void heap_instance_ended(const void *owner) {
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    std::vector<std::pair<uint64_t, heap::Allocation>> leaks;
    s.blocks.for_each([&](void *p, const Block &b) {
        if (b.owner != owner)
            return false;
        leaks.push_back({b.seq, heap::Allocation{b.size, b.file, b.line}});
        // A real TEE reclaims the whole instance heap; so do we, after reporting.
        std::memset(p, 0, b.size);
        unpoison_spare(p, b.size);
        std::free(p);
        s.live_bytes -= b.size;
        return true;
    });
    std::sort(leaks.begin(), leaks.end(), [](const auto &x, const auto &y) { return x.first < y.first; });
    s.last_leaks.clear();
    for (auto &l : leaks) {
        std::fprintf(stderr, "TA heap leak: %zu bytes allocated at %s:%d\n", l.second.size, l.second.file.c_str(),
                     l.second.line);
        s.last_leaks.push_back(std::move(l.second));
    }
}
} // namespace detail
} // namespace tee_host

using namespace tee_host;

extern "C" {

void *TEE_MallocAt(uint32_t size, uint32_t hint, const char *file, int line) {
    return allocate(size, hint, file, line);
}

void *TEE_ReallocAt(void *buffer, uint32_t newSize, const char *file, int line) {
    return reallocate(buffer, newSize, file, line);
}

void *TEE_Malloc(uint32_t size, uint32_t hint) {
    return allocate(size, hint, nullptr, 0);
}

void *TEE_Realloc(void *buffer, uint32_t newSize) {
    return reallocate(buffer, newSize, nullptr, 0);
}

void TEE_Free(void *buffer) {
    if (!buffer)
        return;
    HeapState &s = state();
    std::lock_guard<std::mutex> lock(s.mu);
    const Block *found = s.blocks.find(buffer);
    if (!found)
        detail::panic("TEE_Free of a pointer the heap did not hand out");
    s.live_bytes -= found->size;
    unpoison_spare(buffer, found->size);
    s.blocks.erase(buffer);
    std::free(buffer);
}

void TEE_MemMove(void *dest, const void *src, uint32_t size) {
    if (size)
        std::memmove(dest, src, size);
}

int32_t TEE_MemCompare(const void *buffer1, const void *buffer2, uint32_t size) {
    if (!size)
        return 0;
    int r = std::memcmp(buffer1, buffer2, size);
    return r < 0 ? -1 : (r > 0 ? 1 : 0);
}

void TEE_MemFill(void *buffer, uint32_t x, uint32_t size) {
    if (size)
        std::memset(buffer, static_cast<int>(x & 0xFF), size);
}

void TEE_Panic(TEE_Result panicCode) {
    std::fprintf(stderr, "TEE_Panic: TA panicked with 0x%08x\n", panicCode);
    std::fflush(stderr);
    std::abort();
}

} // extern "C"

namespace tee_host::detail {
void panic(const char *what) {
    std::fprintf(stderr, "TEE platform panic: %s\n", what);
    std::fflush(stderr);
    std::abort();
}
} // namespace tee_host::detail
