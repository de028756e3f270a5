#include "fscanner/fscommon/utils.h"

#include <sys/time.h>

#include <cctype>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <cwctype>
#include <new>

unsigned int getTickCount() {
    struct timeval now;
    gettimeofday(&now, nullptr);
    // Computed in 64 bits, then cut: the wrap of the 32-bit value is the
    // documented behaviour, an overflow of long on a 32-bit target is not.
    unsigned long long ms = static_cast<unsigned long long>(now.tv_sec) * 1000ULL +
                            static_cast<unsigned long long>(now.tv_usec) / 1000ULL;
    return static_cast<unsigned int>(ms);
}

namespace utils {

char* myWcsToMbsString(const wchar_t* text) {
    if (text == nullptr) return nullptr;
    size_t size = wcslen(text) * MB_CUR_MAX + 3;
    char* out = new (std::nothrow) char[size];
    if (out == nullptr) return nullptr;
    std::memset(out, 0, size);
    if (wcstombs(out, text, size) == static_cast<size_t>(-1)) {
        // A partial conversion may have been written: the caller gets an
        // empty text, never half a path.
        std::memset(out, 0, size);
    }
    return out;
}

wchar_t* myMbsToWcsString(const char* text) {
    if (text == nullptr) return nullptr;
    size_t size = std::strlen(text) * MB_CUR_MAX + 3;
    wchar_t* out = new (std::nothrow) wchar_t[size];
    if (out == nullptr) return nullptr;
    wmemset(out, 0, size);
    if (mbstowcs(out, text, size) == static_cast<size_t>(-1)) {
        wmemset(out, 0, size);
    }
    return out;
}

void stringToLower(std::string& text) {
    for (size_t i = 0; i < text.size(); ++i) {
        text[i] = static_cast<char>(std::tolower(static_cast<unsigned char>(text[i])));
    }
}

void stringToLower(std::wstring& text) {
    for (size_t i = 0; i < text.size(); ++i) {
        text[i] = static_cast<wchar_t>(std::towlower(static_cast<wint_t>(text[i])));
    }
}

template <typename StringType>
static void replaceAll(StringType& text, const StringType& from, const StringType& to) {
    if (from.empty()) return;
    typename StringType::size_type at = text.find(from);
    while (at != StringType::npos) {
        text.replace(at, from.size(), to);
        at = text.find(from, at + to.size());
    }
}

void replaceAllStrings(std::string& text, const std::string& from, const std::string& to) {
    replaceAll(text, from, to);
}

void replaceAllStrings(std::wstring& text, const std::wstring& from, const std::wstring& to) {
    replaceAll(text, from, to);
}

}  // namespace utils
