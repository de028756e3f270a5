#include "base/kelmem.h"

#include <atomic>
#include <cstdlib>
#include <cstring>

namespace {

// Requests left before the drill makes them fail; negative: no drill.
std::atomic<long> allocationsLeft{-1};

// True when this request is to fail.  Without a drill it costs one load.
bool failThisRequest() {
    long left = allocationsLeft.load(std::memory_order_relaxed);
    while (left >= 0) {
        if (left == 0) return true;
        if (allocationsLeft.compare_exchange_weak(left, left - 1, std::memory_order_relaxed)) return false;
    }
    return false;
}

}  // namespace

void* kelm_malloc(size_t size) {
    if (failThisRequest()) return nullptr;
    return std::malloc(size == 0 ? 1 : size);
}

void kelm_free(void* block) { std::free(block); }

void* kelm_realloc(void* block, size_t size) {
    if (failThisRequest()) return nullptr;
    return std::realloc(block, size == 0 ? 1 : size);
}

void kelm_failAfter(long allocations) { allocationsLeft.store(allocations < 0 ? -1 : allocations); }

char* i_strdup(const char* text) {
    if (text == nullptr) return nullptr;
    size_t n = std::strlen(text) + 1;
    char* copy = static_cast<char*>(kelm_malloc(n));
    if (copy != nullptr) std::memcpy(copy, text, n);
    return copy;
}
