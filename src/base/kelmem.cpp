#include "base/kelmem.h"

#include <cstdlib>
#include <cstring>

void* kelm_malloc(size_t size) { return std::malloc(size == 0 ? 1 : size); }

void kelm_free(void* block) { std::free(block); }

void* kelm_realloc(void* block, size_t size) { return std::realloc(block, size == 0 ? 1 : size); }

char* i_strdup(const char* text) {
    if (text == nullptr) return nullptr;
    size_t n = std::strlen(text) + 1;
    char* copy = static_cast<char*>(kelm_malloc(n));
    if (copy != nullptr) std::memcpy(copy, text, n);
    return copy;
}
