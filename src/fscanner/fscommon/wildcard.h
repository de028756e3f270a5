// Wildcard matching and the small wide-string comparisons the whole library
// uses.  Throughout, a caseSensitive flag that is true means case-sensitive;
// only matchWildcard's ignoreCase flag has the opposite sense.
//
// In every matcher "*" stands for any run of characters (the empty run
// included) and "?" for exactly one character.
#ifndef FSCANNER_FSCOMMON_WILDCARD_H
#define FSCANNER_FSCOMMON_WILDCARD_H

#include <cstddef>
#include <cstdint>
#include <cwchar>
#include <string>
#include <type_traits>
#include <vector>

#include "fscanner/fscommon/utils.h"

namespace utils {

// The name-mask matcher: iterative, one remembered restart position.  It is
// not a full backtracking matcher; its answers are the ones the query's name
// masks have always had.  An empty text gives true only for a mask of stars
// (or an empty mask).  Null gives false.
template <typename CharType>
bool matchWildcard(const CharType* mask, const CharType* text);

template <>
bool matchWildcard<char>(const char* mask, const char* text);
template <>
bool matchWildcard<wchar_t>(const wchar_t* mask, const wchar_t* text);

// The same on string objects (std::string, std::wstring).  Raw pointers of
// either constness go to the form above.
template <typename StringType,
          typename = typename std::enable_if<std::is_class<StringType>::value>::type>
bool matchWildcard(StringType& mask, StringType& text) {
    return matchWildcard(mask.c_str(), text.c_str());
}

// Lowers both strings in place when ignoreCase is set, then matches.
template <typename StringType,
          typename = typename std::enable_if<std::is_class<StringType>::value>::type>
bool matchWildcard(StringType& mask, StringType& text, bool ignoreCase) {
    if (ignoreCase) {
        stringToLower(mask);
        stringToLower(text);
    }
    return matchWildcard(mask.c_str(), text.c_str());
}

// The matcher with "\*" and "\?" as literal characters in the mask.  Both
// arguments are modified: in the text every "*" and "?" becomes U+0001 and
// U+0002, in the mask every "\*" and "\?" does, so an escaped star matches
// only a literal star while an unescaped one keeps its wildcard meaning.
template <typename CharType, typename StringType>
bool matchWildcardEscapedSupport(StringType& mask, StringType& text) {
    const CharType allChars[] = {CharType(1), CharType(0)};
    const CharType singleChar[] = {CharType(2), CharType(0)};
    const CharType asterisk[] = {CharType('*'), CharType(0)};
    const CharType questionMark[] = {CharType('?'), CharType(0)};
    const CharType escapedAsterisk[] = {CharType('\\'), CharType('*'), CharType(0)};
    const CharType escapedQuestionMark[] = {CharType('\\'), CharType('?'), CharType(0)};
    const StringType WILDCARD_ALL_CHARS(allChars);
    const StringType WILDCARD_SINGLE_CHAR(singleChar);
    const StringType WILDCARD_ASTERISK(asterisk);
    const StringType WILDCARD_QUESTION_MARK(questionMark);
    const StringType WILDCARD_ESCAPED_ASTERISK(escapedAsterisk);
    const StringType WILDCARD_ESCAPED_QUESTION_MARK(escapedQuestionMark);
    replaceAllStrings(text, WILDCARD_ASTERISK, WILDCARD_ALL_CHARS);
    replaceAllStrings(text, WILDCARD_QUESTION_MARK, WILDCARD_SINGLE_CHAR);
    replaceAllStrings(mask, WILDCARD_ESCAPED_ASTERISK, WILDCARD_ALL_CHARS);
    replaceAllStrings(mask, WILDCARD_ESCAPED_QUESTION_MARK, WILDCARD_SINGLE_CHAR);
    return matchWildcard(mask.c_str(), text.c_str());
}

}  // namespace utils

// Glob compare.  With prefixOk, a text that ends while the pattern goes on
// still matches.  wildcasecmp compares through towlower.  Null gives false.
bool wildcmp(const wchar_t* pattern, const wchar_t* text, bool prefixOk);
bool wildcasecmp(const wchar_t* pattern, const wchar_t* text, bool prefixOk);
// wildcmp when caseSensitive, wildcasecmp otherwise; prefixOk false.
bool wildvccmp(const wchar_t* pattern, const wchar_t* text, bool caseSensitive);

// wildvccmp on the stored UTF-8 bytes of a name, for a pattern and a text
// that are both plain ASCII (bytes 1..127): there each byte is one character,
// so the answer is the one wildvccmp gives on the wide forms.  fold maps every
// ASCII byte to towlower of it (FoldedByteCase::fromLocale); it is used only
// when caseSensitive is false.  The text is [text, text + length) and need not
// end in a zero; the pattern does.
struct FoldedByteCase {
    // towlower of each ASCII code in the current locale, which may send a
    // letter outside ASCII (the Turkish capital I does).
    uint32_t lower[128];
    static FoldedByteCase fromLocale();
};
bool asciiWildvccmp(const unsigned char* pattern, const unsigned char* text, size_t length,
                    bool caseSensitive, const FoldedByteCase& fold);
// True when every byte of [text, text + length) is in 1..127.
bool isPlainAscii(const unsigned char* text, size_t length);

// Path glob: "*" and "?" cross separators.  With recursive, a pattern also
// matches every path below it.  The text "/usr" matches "/usr/" and "/usr/*".
// Without recursive the pattern "/usr" does not match the text "/usr/", while
// a pattern that reached its end after a "*" does match a text whose only
// remainder is a final separator (kept as it is).
bool wildpathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive);
bool wildcasepathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive);
bool wildvcpathcmp(const wchar_t* pattern, const wchar_t* text, bool recursive, bool caseSensitive);

// True when the text holds "*" or "?".
bool checkWildCard(const wchar_t* text);

// wcscmp / wcsncmp when caseSensitive, wcscasecmp / wcsncasecmp otherwise.
int wcsvccmp(const wchar_t* a, const wchar_t* b, bool caseSensitive);
int wcsnvccmp(const wchar_t* a, const wchar_t* b, size_t n, bool caseSensitive);

#endif
