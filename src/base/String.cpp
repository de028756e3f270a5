#include "base/String.h"

#include <cstring>
#include <strings.h>

#include "base/kelmem.h"

namespace {
char* copyText(const char* text, int* length) {
    size_t n = text != nullptr ? std::strlen(text) : 0;
    char* block = static_cast<char*>(kelm_malloc(n + 1));
    if (block == nullptr) {
        *length = 0;
        return nullptr;
    }
    if (n != 0) std::memcpy(block, text, n);
    block[n] = '\0';
    *length = static_cast<int>(n);
    return block;
}
}  // namespace

String::String() : text_(nullptr), length_(0) { text_ = copyText(nullptr, &length_); }

String::String(const char* text) : text_(nullptr), length_(0) { text_ = copyText(text, &length_); }

String::String(const String& other) : text_(nullptr), length_(0) {
    text_ = copyText(other.text_, &length_);
}

String& String::operator=(const String& other) {
    if (this != &other) {
        int n = 0;
        char* copy = copyText(other.text_, &n);
        kelm_free(text_);
        text_ = copy;
        length_ = n;
    }
    return *this;
}

String::~String() { kelm_free(text_); }

int String::length() const { return length_; }

char String::charAt(int index) const {
    if (index < 0 || index >= length_ || text_ == nullptr) return '\0';
    return text_[index];
}

int String::compareTo(const String& other, int ignoreCase) const {
    const char* a = text_ != nullptr ? text_ : "";
    const char* b = other.text_ != nullptr ? other.text_ : "";
    return ignoreCase ? strcasecmp(a, b) : std::strcmp(a, b);
}

String::operator const char*() const { return text_ != nullptr ? text_ : ""; }
