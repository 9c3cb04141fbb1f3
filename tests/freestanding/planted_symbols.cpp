/*
 * planted_symbols.cpp - what the freestanding check must refuse, one of
 * each: operator new and delete, a global whose destructor is registered
 * at start-up (__cxa_atexit, a static constructor), thread-local data and
 * a C library function that a TEE does not offer.
 */
#include <cstring>

struct planted_counter_t {
    ~planted_counter_t() { total = 0; }
    int total = 1;
};

planted_counter_t planted_counter;
thread_local int planted_tls = 0;
int *planted_cell = nullptr;

extern "C" int planted_keep(int v) {
    planted_cell = new int(v);
    planted_tls += *planted_cell;
    return planted_tls + planted_counter.total;
}

extern "C" void planted_drop() {
    delete planted_cell;
    planted_cell = nullptr;
}

extern "C" int planted_compare(const char *a, const char *b) {
    return std::strcmp(a, b);
}
