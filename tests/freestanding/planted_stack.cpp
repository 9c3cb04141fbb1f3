/*
 * planted_stack.cpp - what the stack budget must refuse, one of each: a
 * frame above the budget, recursion deep enough to pass it, recursion
 * without a depth, a call through a pointer that no table line lists, a
 * function whose address is taken for no listed call, and a frame of
 * dynamic size.
 */
#include <cstdint>

extern "C" void TEE_MemFill(void *buffer, uint32_t x, uint32_t size);

extern "C" uint32_t planted_big() {
    uint8_t block[9000];
    TEE_MemFill(block, 0, sizeof block);
    return block[17];
}

// Listed with a depth of 1000 in planted_stack.table.
extern "C" uint32_t planted_walk(const uint8_t *from, uint32_t n) {
    uint8_t local[32];
    TEE_MemFill(local, from ? from[0] : 0, sizeof local);
    return n ? planted_walk(local, n - 1) + local[3] : local[5];
}

extern "C" uint32_t planted_deep() {
    return planted_walk(nullptr, 3);
}

extern "C" uint32_t planted_spin(const uint8_t *from, uint32_t n) {
    uint8_t local[32];
    TEE_MemFill(local, from ? from[1] : 0, sizeof local);
    return n ? planted_spin(local, n - 1) + local[7] : local[9];
}

using planted_step_fn = uint32_t (*)(uint32_t);
planted_step_fn planted_step = nullptr;

extern "C" uint32_t planted_double(uint32_t v) {
    return v * 2;
}

extern "C" void planted_set_step() {
    planted_step = planted_double;
}

extern "C" uint32_t planted_dispatch(uint32_t v) {
    return planted_step ? planted_step(v) : 0;
}

extern "C" uint32_t planted_alloca(uint32_t n) {
    auto *p = static_cast<uint8_t *>(__builtin_alloca(n));
    TEE_MemFill(p, 0, n);
    return p[0];
}
