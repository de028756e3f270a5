// StringList, the small owned-string list of the file type check and the
// direct walk.  It lives on its own so that the type check does not need the
// walk's header for it.
#ifndef FSCANNER_FSCOMMON_STRLIST_H
#define FSCANNER_FSCOMMON_STRLIST_H

#include <cstring>
#include <cwchar>
#include <vector>

#include "base/kelmem.h"

// An ordered list of owned strings (copies from kelm_malloc).  CharType is
// char or wchar_t.  Not copyable.
template <typename CharType>
class StringList {
public:
    StringList() {}
    ~StringList() { clear(); }

    // Appends a copy.  False for null or a failed allocation.
    bool insert(const CharType* text) {
        if (text == nullptr) return false;
        size_t n = length(text) + 1;
        CharType* copy = static_cast<CharType*>(kelm_malloc(n * sizeof(CharType)));
        if (copy == nullptr) return false;
        std::memcpy(copy, text, n * sizeof(CharType));
        items.push_back(copy);
        return true;
    }
    // Index of the first string equal to text, -1 if none (or text is null).
    int find(const CharType* text) const {
        if (text == nullptr) return -1;
        for (size_t i = 0; i < items.size(); ++i) {
            if (equal(items[i], text)) return static_cast<int>(i);
        }
        return -1;
    }
    // Releases every string.
    void clear() {
        for (size_t i = 0; i < items.size(); ++i) kelm_free(items[i]);
        items.clear();
    }
    int size() const { return static_cast<int>(items.size()); }
    // The string at index, owned by the list; null out of range.
    CharType* at(int index) const {
        if (index < 0 || static_cast<size_t>(index) >= items.size()) return nullptr;
        return items[static_cast<size_t>(index)];
    }

private:
    StringList(const StringList&);
    StringList& operator=(const StringList&);

    static size_t length(const char* text) { return std::strlen(text); }
    static size_t length(const wchar_t* text) { return wcslen(text); }
    static bool equal(const char* a, const char* b) { return std::strcmp(a, b) == 0; }
    static bool equal(const wchar_t* a, const wchar_t* b) { return wcscmp(a, b) == 0; }

    std::vector<CharType*> items;
};

#endif
