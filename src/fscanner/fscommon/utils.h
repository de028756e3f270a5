// Conversions between wide and multibyte text, in-place string helpers and
// the millisecond clock.  The conversions follow the current C locale
// (LC_CTYPE), as every system call of the library does.
#ifndef FSCANNER_FSCOMMON_UTILS_H
#define FSCANNER_FSCOMMON_UTILS_H

#include <string>

// Wall clock in milliseconds (gettimeofday: tv_sec * 1000 + tv_usec / 1000),
// cut to 32 bits.  Differences of two readings are meaningful, the value
// itself is not.
unsigned int getTickCount();

namespace utils {

using ::getTickCount;

// The separator of the library's paths.  It lives here, below everything that
// builds or splits paths, so that text helpers need not see the path module;
// PathHelper::PathSeparator is the same character.
constexpr wchar_t PathSeparator = L'/';

// New new[] block of length * MB_CUR_MAX + 3 bytes, zeroed and filled by
// wcstombs.  A failed conversion leaves it empty, not null.  Null for null.
// The caller releases it with delete[].
char* myWcsToMbsString(const wchar_t* text);

// The same the other way by mbstowcs: a new[] wide block, empty when the text
// can't be converted, null for null.  Released with delete[].
wchar_t* myMbsToWcsString(const char* text);

// Lower-cases in place, character by character (tolower / towlower).
void stringToLower(std::string& text);
void stringToLower(std::wstring& text);

// Replaces every occurrence of from by to, going on behind each replacement,
// so a to that holds from does not loop.  An empty from changes nothing.
void replaceAllStrings(std::string& text, const std::string& from, const std::string& to);
void replaceAllStrings(std::wstring& text, const std::wstring& from, const std::wstring& to);

}  // namespace utils

#endif
