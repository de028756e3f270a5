#include "fscanner/fscommon/wildcard.h"

#include <cwctype>
#include <type_traits>

#include "fscanner/fscommon/utils.h"

namespace {

const wchar_t kSeparator = utils::PathSeparator;

// The name-mask matcher.  The three steps of the loop are labelled as they
// are used: read the mask (step 1), compare one character (step 2), advance
// both (step 3).  The guards marked "end" keep the walk inside both strings
// where the plain steps would read past the end of the text; on every other
// input the answers are those of the steps alone.
template <typename CharType>
bool matchMask(const CharType* mask, const CharType* text) {
    if (mask == nullptr || text == nullptr) return false;
    const CharType star = CharType('*');
    const CharType any = CharType('?');
    const CharType* restartMask = nullptr;
    const CharType* restartText = nullptr;
    const CharType* m = mask;
    const CharType* t = text;
    CharType c;
    CharType d;

step1:
    c = *m;
    if (c == star) {
        while (*m == star) ++m;
        if (*m == 0) return true;
        restartMask = m;
        restartText = t;
        c = *m;
        if (c != any) {
            while (*t != c) {
                if (*t == 0) return false;
                ++t;
                restartText = t;
            }
        }
        goto step3;
    }

step2:
    d = *t;
    if (c == d || c == any) goto step3;
    if (restartMask == nullptr) return false;
    if (m == restartMask) {
        if (d == 0) return false;
        ++t;
        goto step1;
    }
    if (d == *restartMask) {
        m = restartMask + 1;
        if (d == 0) return false;
        ++t;
        goto step1;
    }
    if (*restartText == 0) return false;  // end: no later start is left
    ++restartText;
    t = restartText;
    m = restartMask;
    c = *m;
    goto step2;

step3:
    if (*t == 0) return *m == 0;  // end: both ended together, or "?" wants one more
    ++m;
    ++t;
    if (*t == 0) {
        while (*m == star) ++m;
        return *m == 0;
    }
    goto step1;
}

struct SameCase {
    bool operator()(wchar_t a, wchar_t b) const { return a == b; }
};

struct FoldedCase {
    bool operator()(wchar_t a, wchar_t b) const {
        return std::towlower(static_cast<wint_t>(a)) == std::towlower(static_cast<wint_t>(b));
    }
};

template <typename Equal>
bool globCompare(const wchar_t* pattern, const wchar_t* text, bool prefixOk) {
    if (pattern == nullptr || text == nullptr) return false;
    Equal equal;
    const wchar_t* p = pattern;
    const wchar_t* t = text;
    while (*t != 0 && *p != L'*') {
        if (*p != L'?' && !equal(*p, *t)) return false;
        ++p;
        ++t;
    }
    const wchar_t* markPattern = nullptr;
    const wchar_t* markText = nullptr;
    while (*t != 0) {
        if (*p == L'*') {
            ++p;
            if (*p == 0) return true;
            markPattern = p;
            markText = t + 1;
        } else if (*p != 0 && (*p == L'?' || equal(*p, *t))) {
            ++p;
            ++t;
        } else {
            p = markPattern;
            t = markText++;
        }
    }
    while (*p == L'*') ++p;
    return *p == 0 || prefixOk;
}

template <typename Equal>
bool pathGlobCompare(const wchar_t* pattern, const wchar_t* text, bool recursive) {
    if (pattern == nullptr || text == nullptr) return false;
    Equal equal;
    const wchar_t* p = pattern;
    const wchar_t* t = text;
    // Before the first "*": one by one.  The same characters, none of them
    // special, are passed over first in a tighter loop (most of a path under
    // an include path is such a run); the loop below goes on from there.
    if (std::is_same<Equal, SameCase>::value) {
        while (*p == *t && *p != 0 && *p != L'*' && *p != L'?') {
            ++p;
            ++t;
        }
    }
    while (*t != 0 && *p != L'*') {
        if (*p != 0 && (*p == L'?' || equal(*p, *t))) {
            ++p;
            ++t;
            continue;
        }
        if (*p == 0 && recursive) {
            // The pattern names a directory above the text.
            if (*t == kSeparator) return true;
            if (t > text && t[-1] == kSeparator) return true;
        }
        return false;
    }
    const wchar_t* markPattern = nullptr;
    const wchar_t* markText = nullptr;
    while (*t != 0) {
        if (*p == L'*') {
            ++p;
            if (*p == 0) return true;
            markPattern = p;
            markText = t + 1;
        } else if (*p != 0 && (*p == L'?' || equal(*p, *t))) {
            ++p;
            ++t;
        } else {
            if (*p == 0 && *t == kSeparator && (recursive || t[1] == 0)) return true;
            p = markPattern;
            t = markText++;
        }
    }
    bool skipped = false;
    while (*p == L'*') {
        ++p;
        skipped = true;
    }
    if (*p == 0) return true;
    if (skipped) return false;
    if (*p != kSeparator) return false;
    return p[1] == 0 || (p[1] == L'*' && p[2] == 0);
}

}  // namespace

namespace utils {

template <>
bool matchWildcard<char>(const char* mask, const char* text) {
    return matchMask(mask, text);
}

template <>
bool matchWildcard<wchar_t>(const wchar_t* mask, const wchar_t* text) {
    return matchMask(mask, text);
}

}  // namespace utils

bool wildcmp(const wchar_t* pattern, const wchar_t* text, bool prefixOk) {
    return globCompare<SameCase>(pattern, text, prefixOk);
}

bool wildcasecmp(const wchar_t* pattern, const wchar_t* text, bool prefixOk) {
    return globCompare<FoldedCase>(pattern, text, prefixOk);
}

bool wildvccmp(const wchar_t* pattern, const wchar_t* text, bool caseSensitive) {
    return caseSensitive ? wildcmp(pattern, text, false) : wildcasecmp(pattern, text, false);
}

namespace {

// globCompare over bytes: the same steps, with the text's end given by a
// pointer instead of a zero.  The callers hand only ASCII, where a byte is a
// character and the pattern's zero is never equal to a text byte.
template <typename Equal>
bool byteGlobCompare(const unsigned char* p, const unsigned char* t, const unsigned char* end,
                     Equal equal) {
    while (t != end && *p != '*') {
        if (*p != '?' && !equal(*p, *t)) return false;
        ++p;
        ++t;
    }
    const unsigned char* markPattern = nullptr;
    const unsigned char* markText = nullptr;
    while (t != end) {
        if (*p == '*') {
            ++p;
            if (*p == 0) return true;
            markPattern = p;
            markText = t + 1;
        } else if (*p != 0 && (*p == '?' || equal(*p, *t))) {
            ++p;
            ++t;
        } else {
            p = markPattern;
            t = markText++;
        }
    }
    while (*p == '*') ++p;
    return *p == 0;
}

}  // namespace

FoldedByteCase FoldedByteCase::fromLocale() {
    FoldedByteCase fold;
    for (unsigned int c = 0; c < 128; ++c) fold.lower[c] = static_cast<uint32_t>(std::towlower(static_cast<wint_t>(c)));
    return fold;
}

bool asciiWildvccmp(const unsigned char* pattern, const unsigned char* text, size_t length,
                    bool caseSensitive, const FoldedByteCase& fold) {
    if (pattern == nullptr || text == nullptr) return false;
    const unsigned char* end = text + length;
    if (caseSensitive)
        return byteGlobCompare(pattern, text, end, [](unsigned char a, unsigned char b) { return a == b; });
    const uint32_t* lower = fold.lower;
    return byteGlobCompare(pattern, text, end, [lower](unsigned char a, unsigned char b) {
        return lower[a & 0x7F] == lower[b & 0x7F];
    });
}

bool isPlainAscii(const unsigned char* text, size_t length) {
    for (size_t i = 0; i < length; ++i)
        if (text[i] == 0 || text[i] >= 0x80) return false;
    return true;
}

bool wildpathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive) {
    return pathGlobCompare<SameCase>(pattern, text, recursive);
}

bool wildcasepathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive) {
    return pathGlobCompare<FoldedCase>(pattern, text, recursive);
}

bool wildvcpathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive, bool caseSensitive) {
    return caseSensitive ? wildpathcmp(pattern, text, recursive)
                         : wildcasepathcmp(pattern, text, recursive);
}

bool checkWildCard(const wchar_t* text) {
    if (text == nullptr) return false;
    return wcschr(text, L'*') != nullptr || wcschr(text, L'?') != nullptr;
}

int wcsvccmp(const wchar_t* a, const wchar_t* b, bool caseSensitive) {
    return caseSensitive ? wcscmp(a, b) : wcscasecmp(a, b);
}

int wcsnvccmp(const wchar_t* a, const wchar_t* b, size_t n, bool caseSensitive) {
    return caseSensitive ? wcsncmp(a, b, n) : wcsncasecmp(a, b, n);
}
