// Small common helpers over wide and narrow text: number and time formats,
// UTF-8 conversions, trimming, splitting, a resumable tokeniser, temporary and
// debug files.
//
// Ownership: a function that returns a new wide string hands over a block
// from kelm_malloc (release it with kelm_free) unless its comment says
// otherwise.  Functions that work "in place" write into the caller's buffer
// and return it.
//
// Threads: tokenize, wcs_itoa and wcs_itoa64 (with a null output) and the
// debug file functions keep process-wide state; call them from one thread at
// a time.  Everything else is reentrant.
//
// The matching helpers (wild*, wcsvccmp) live in wildcard.h, checkPathList
// with the path records in fs_fileinfo.h, and the wide/narrow conversions in
// utils.h.
#ifndef FSCANNER_FSCOMMON_STRINGHELPER_H
#define FSCANNER_FSCOMMON_STRINGHELPER_H

#include <sys/time.h>

#include <cstddef>
#include <cstdint>
#include <ctime>
#include <new>
#include <string>
#include <vector>

// ---- free functions over wide strings --------------------------------------

// Pointer to the first c in the closed range from..to; null if there is none,
// if either pointer is null, or if from stands behind to.
wchar_t* wcsbtw(wchar_t* from, wchar_t* to, wchar_t c);

// First occurrence of b in a by plain search; a itself for an empty b; null
// when b does not occur or an argument is null.
wchar_t* my_wcswcs(wchar_t* a, const wchar_t* b);
const wchar_t* my_wcswcs(const wchar_t* a, const wchar_t* b);

// Decimal digits of value into out (at least 11 characters), or into a
// process-wide block when out is null.  Returns the buffer written.
wchar_t* wcs_itoa(unsigned int value, wchar_t* out);
// The same for 64 bits (out of at least 21 characters), with a process-wide
// block of its own.
wchar_t* wcs_itoa64(unsigned long long value, wchar_t* out);

// Value of a text of decimal digits, read as a signed 64-bit conversion of at
// most 23 digits: digits behind the 23rd are not read, and a value above
// 9223372036854775807 gives that maximum.  0 when the text is null, empty or
// holds any character that is not a digit.
unsigned long long str2uint64(const wchar_t* text);

// Every a becomes b, in place.  Null is allowed and returned.
wchar_t* replaceChar(wchar_t* s, wchar_t a, wchar_t b);

// Remove blanks (U+0020 only; tabs stay) at the end or the start, in place.
// Return the argument (null for null).
wchar_t* rtrim(wchar_t* s);
wchar_t* ltrim(wchar_t* s);

// Lower-cases in place by towlower; returns the argument.
wchar_t* wcstowlower(wchar_t* s);
// Upper-cases by towupper into out (which must hold the text of in), or in
// place; returns the buffer written.
wchar_t* wcsupper(wchar_t* in, wchar_t* out);
wchar_t* wcsupper(wchar_t* s);

// New kelm_malloc copy of text (release with kelm_free); null for a null
// text or a failed allocation.
wchar_t* wideDuplicate(const wchar_t* text);

// Copies src to *dst.  A null *dst gets a new kelm_malloc block; the block is
// replaced only when src is longer than the text already in it, so a shorter
// copy reuses the caller's block.  A null src (or dst) does nothing.
// Returns *dst (null if an allocation failed).
wchar_t* __wcscpy(wchar_t** dst, const wchar_t* src);

// New string of dir, the path separator unless dir already ends in it, and
// name.  Null if an argument is null or the allocation fails.
wchar_t* getFullPathName(const wchar_t* dir, const wchar_t* name);

// Splits path at its last sep into two new strings: *dir gets the text before
// it, *name the text behind it.  Returns false, and sets both to null, when an
// argument is null, path holds no sep or an allocation fails.
bool fullPath2Component(wchar_t* path, wchar_t sep, wchar_t** dir, wchar_t** name);

// New string of text with every find replaced by replace, scanning on behind
// each replacement.  Null if an argument is null; an empty find replaces
// nothing and gives a copy of text.
wchar_t* insertAndReplaceString(const wchar_t* text, const wchar_t* find, const wchar_t* replace);

// Puts prefix in front of the text in buffer, whose capacity is size
// characters.  Returns 0 (buffer untouched) when the prefix length plus the
// buffer's text length plus 4 exceeds size, or an argument is null; else 1.
int wcs_stringCat(wchar_t* prefix, wchar_t* buffer, unsigned int size);

// Milliseconds from start to end, as an unsigned 32-bit value (a negative
// span wraps).
uint32_t elapsedTime(timeval start, timeval end);

// rename and remove on the narrow forms of the names.  Return 0 on success,
// -1 on failure (also for a null name).
int renameFile(wchar_t* from, wchar_t* to);
int removeFile(wchar_t* name);

// Creates a new empty file in the current directory and returns its name as
// a new[] block: "./kel_<i>", or "./<prefix><i>" when prefix is given, for the
// first i from 0 upward whose file does not exist yet and can be created.
// The search has no upper bound.
char* getTempFile_Default(char* prefix);

// Name of the plain debug file, independent of the trace library.
extern char debugFile[4096];
// Switches debug output on, to the current debugFile (startDebug()) or to a
// new name.  stopDebug() switches it off.  debug() appends one formatted
// message while it is on and does nothing otherwise.
void startDebug();
void startDebug(const char* name);
void stopDebug();
void debug(const char* format, ...) __attribute__((format(printf, 1, 2)));

// Resumable tokeniser with process-wide position, as strtok has.  A non-null
// text starts a new run, null goes on with the last one.  token is an area of
// size BYTES, cleared first.  "(", ")", "&", "|" and "!" are tokens of one
// character and end a token that has begun.  Blanks (space, tab) outside
// double quotes are dropped; a quoted text is copied without its quotes and
// keeps its blanks.  Returns 1, or 0 when the token does not fit (the
// position then stays at the start of that token).  At the end of the text
// the token is empty and the result is 1.
int tokenize(const wchar_t* text, wchar_t* token, unsigned int size);

namespace utils {

// A grow-only buffer: a pointer and a capacity in elements.  It owns its
// block (new[]); growing gives a new zeroed block and drops the old contents.
// Not copyable.
template <typename T>
class DynamicBuffer {
public:
    DynamicBuffer() : buffer_(nullptr), capacity_(0) {}
    ~DynamicBuffer() { delete[] buffer_; }
    DynamicBuffer(const DynamicBuffer&) = delete;
    DynamicBuffer& operator=(const DynamicBuffer&) = delete;

    // Makes the capacity at least n elements.  A smaller buffer is replaced by
    // a new zeroed block of exactly n; a large enough one is kept as it is.
    // Returns false (buffer unchanged) when the allocation fails.
    bool ensure(unsigned int n) {
        if (n <= capacity_) return true;
        T* fresh = new (std::nothrow) T[n]();
        if (fresh == nullptr) return false;
        delete[] buffer_;
        buffer_ = fresh;
        capacity_ = n;
        return true;
    }
    // Frees the block; the capacity returns to 0.
    void release() {
        delete[] buffer_;
        buffer_ = nullptr;
        capacity_ = 0;
    }
    T* get() const { return buffer_; }
    unsigned int capacity() const { return capacity_; }

private:
    T* buffer_;
    unsigned int capacity_;
};

// Encodes in as UTF-8 into out, of which size - 1 bytes are usable, and ends
// it with a NUL.  Returns the number of characters encoded (not bytes); 0 for
// a null out or size 0.  With n bytes left, a character below 0x80 takes one
// byte; below 0x800 two bytes only if n > 2; below 0x10000 three only if
// n > 3; below 0x110000 four only if n > 4; anything above becomes "?".  A
// character that does not fit is skipped, and later shorter ones may still be
// written: the margin is one byte larger than needed, on purpose.
unsigned int stringToUTF8(unsigned char* out, unsigned int size, const wchar_t* in);
// The same into buffer, which first grows to 6 * length + 1 bytes if smaller
// (never shrinks).  0 when the buffer cannot grow.
unsigned int stringToUTF8(DynamicBuffer<unsigned char>& buffer, const wchar_t* in);

// Decodes UTF-8 leniently into out: at most size - 1 characters and a NUL.
// Returns the number written; 0 for a null out or size 0.  A byte below 0x80
// is itself; a stray continuation byte (0x80..0xBF) gives its low six bits; a
// lead byte takes in one following byte per set bit from 0x20 downward plus
// one for the first clear bit, six bits each, without checking them, so a
// truncated sequence swallows the bytes behind it.  A sequence cut by the end
// of the text is dropped and ends the decoding.
unsigned int utf8ToWideChar(wchar_t* out, unsigned int size, const unsigned char* in);

// Time formats, all in UTC by gmtime.  Each clears buffer (size bytes) and
// writes the time; returns 0, or -1 for a null buffer, a size of 0 or a
// failed gmtime.
int timeToFIF(long time, char* buffer, unsigned int size);  // "%Y-%m-%d,%H:%M:%S"
int timeToXML(long time, char* buffer, unsigned int size);  // "%Y-%m-%dT%H:%M:%S"
int timeToMIF(long time, char* buffer, unsigned int size);  // "%Y-%m-%d-%H:%M:%S.000000"
// "%Y%m%d%H%M%S", "_" and a number.  The number is the time minus the local
// instant of 1970-01-01 00:00:00 as a whole count of seconds, held in a
// double and printed through "%u" as the 32-bit target's printf reads it:
// the low 32 bits of the double's IEEE-754 image.  So 0 seconds and most
// small counts print "0"; the odd text is kept on purpose, byte for byte.
int timeToSig(long time, char* buffer, unsigned int size);

// Local date and time as "%Y-%m-%dT%H:%M:%S"; empty if formatting fails.
std::string getLocalDatetimeXML();

// malloc copy (release with free); null for null.
wchar_t* wcsdup2(const wchar_t* s);

// New trimmed copies; white space by isspace / iswspace.
std::string trimLeft(const std::string& s);
std::string trimRight(const std::string& s);
std::string trimBoth(const std::string& s);
std::wstring trimLeft(const std::wstring& s);
std::wstring trimRight(const std::wstring& s);
std::wstring trimBoth(const std::wstring& s);

// Trim in place; the set is tab, line feed, vertical tab, form feed, carriage
// return and blank.  The string forms return their argument; the pointer forms
// move the text to the start of the buffer and return it (null for null).
std::string& trimLeftInPlace(std::string& s);
std::string& trimRightInPlace(std::string& s);
std::string& trimBothInPlace(std::string& s);
std::wstring& trimLeftInPlace(std::wstring& s);
std::wstring& trimRightInPlace(std::wstring& s);
std::wstring& trimBothInPlace(std::wstring& s);
char* trimLeftInPlace(char* s);
char* trimRightInPlace(char* s);
char* trimBothInPlace(char* s);
wchar_t* trimLeftInPlace(wchar_t* s);
wchar_t* trimRightInPlace(wchar_t* s);
wchar_t* trimBothInPlace(wchar_t* s);

// False when b is longer than a.
bool startsWith(const std::string& a, const std::string& b);
bool endsWith(const std::string& a, const std::string& b);

// printf formatting into a std::string, measured by a first vsnprintf.
std::string formatString(const std::string& format, ...);

// The runs of text between delimiters; leading and repeated delimiters give
// no empty token.
std::vector<std::string> split(const std::string& text, std::string delimiters);

// POSIX extended match of regex against text.  out gets the first group (empty
// when the expression has none or it did not take part).  Returns 0 found,
// 1 no match, 4 the expression did not compile (out then stays empty).
int matchString(const char* regex, const char* text, std::string& out);

// The arguments joined by single blanks on one line.
std::string printArgList(int argc, char** argv);
std::wstring printWArgList(int argc, wchar_t** argv);

// time(NULL).
time_t getCurrentEpochTimeSeconds();

}  // namespace utils

#endif
