// Small common helpers over wide and narrow text.  See stringhelper.h for the
// contracts.
#include "fscanner/fscommon/stringhelper.h"

#include <fcntl.h>
#include <regex.h>
#include <sys/types.h>

#include <cctype>
#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <cwctype>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/utils.h"

namespace {

wchar_t* allocWide(size_t characters) {
    return static_cast<wchar_t*>(kelm_malloc(characters * sizeof(wchar_t)));
}

wchar_t* dupWide(const wchar_t* text, size_t length) {
    wchar_t* copy = allocWide(length + 1);
    if (copy == nullptr) return nullptr;
    std::wmemcpy(copy, text, length);
    copy[length] = L'\0';
    return copy;
}

// The narrow form of a wide name, as a new[] block; null for null.
char* narrowName(const wchar_t* name) { return utils::myWcsToMbsString(name); }

}  // namespace

wchar_t* wideDuplicate(const wchar_t* text) {
    if (text == nullptr) return nullptr;
    return dupWide(text, std::wcslen(text));
}

wchar_t* wcsbtw(wchar_t* from, wchar_t* to, wchar_t c) {
    if (from == nullptr || to == nullptr || from > to) return nullptr;
    for (wchar_t* p = from; p <= to; ++p) {
        if (*p == c) return p;
    }
    return nullptr;
}

const wchar_t* my_wcswcs(const wchar_t* a, const wchar_t* b) {
    if (a == nullptr || b == nullptr) return nullptr;
    if (*b == L'\0') return a;
    for (const wchar_t* start = a; *start != L'\0'; ++start) {
        const wchar_t* p = start;
        const wchar_t* q = b;
        while (*p != L'\0' && *p == *q) {
            ++p;
            ++q;
        }
        if (*q == L'\0') return start;
    }
    return nullptr;
}

wchar_t* my_wcswcs(wchar_t* a, const wchar_t* b) {
    return const_cast<wchar_t*>(my_wcswcs(static_cast<const wchar_t*>(a), b));
}

namespace {

template <typename Number>
wchar_t* writeDecimal(Number value, wchar_t* out) {
    wchar_t digits[32];
    int count = 0;
    do {
        digits[count++] = static_cast<wchar_t>(L'0' + static_cast<int>(value % 10));
        value /= 10;
    } while (value != 0);
    for (int i = 0; i < count; ++i) out[i] = digits[count - 1 - i];
    out[count] = L'\0';
    return out;
}

}  // namespace

wchar_t* wcs_itoa(unsigned int value, wchar_t* out) {
    static wchar_t block[16];
    return writeDecimal(value, out != nullptr ? out : block);
}

wchar_t* wcs_itoa64(unsigned long long value, wchar_t* out) {
    static wchar_t block[32];
    return writeDecimal(value, out != nullptr ? out : block);
}

unsigned long long str2uint64(const wchar_t* text) {
    if (text == nullptr || *text == L'\0') return 0;
    for (const wchar_t* p = text; *p != L'\0'; ++p) {
        if (*p < L'0' || *p > L'9') return 0;
    }
    // A signed 64-bit conversion of at most 23 digits: later digits are not
    // read, and a value beyond the signed range stops at its maximum.
    const unsigned long long kMax = 9223372036854775807ULL;
    unsigned long long value = 0;
    for (int i = 0; i < 23 && text[i] != L'\0'; ++i) {
        unsigned long long digit = static_cast<unsigned long long>(text[i] - L'0');
        if (value > (kMax - digit) / 10) return kMax;
        value = value * 10 + digit;
    }
    return value;
}

wchar_t* replaceChar(wchar_t* s, wchar_t a, wchar_t b) {
    if (s == nullptr) return s;
    for (wchar_t* p = s; *p != L'\0'; ++p) {
        if (*p == a) *p = b;
    }
    return s;
}

wchar_t* rtrim(wchar_t* s) {
    if (s == nullptr) return s;
    size_t length = std::wcslen(s);
    while (length > 0 && s[length - 1] == L' ') s[--length] = L'\0';
    return s;
}

wchar_t* ltrim(wchar_t* s) {
    if (s == nullptr) return s;
    size_t skip = 0;
    while (s[skip] == L' ') ++skip;
    if (skip > 0) std::wmemmove(s, s + skip, std::wcslen(s + skip) + 1);
    return s;
}

wchar_t* wcstowlower(wchar_t* s) {
    if (s == nullptr) return s;
    for (wchar_t* p = s; *p != L'\0'; ++p) *p = static_cast<wchar_t>(std::towlower(*p));
    return s;
}

wchar_t* wcsupper(wchar_t* in, wchar_t* out) {
    if (in == nullptr || out == nullptr) return out;
    size_t i = 0;
    for (; in[i] != L'\0'; ++i) out[i] = static_cast<wchar_t>(std::towupper(in[i]));
    out[i] = L'\0';
    return out;
}

wchar_t* wcsupper(wchar_t* s) { return wcsupper(s, s); }

wchar_t* __wcscpy(wchar_t** dst, const wchar_t* src) {
    if (dst == nullptr) return nullptr;
    if (src == nullptr) return *dst;
    size_t length = std::wcslen(src);
    if (*dst == nullptr || length > std::wcslen(*dst)) {
        wchar_t* fresh = allocWide(length + 1);
        if (fresh == nullptr) return nullptr;
        kelm_free(*dst);
        *dst = fresh;
    }
    std::wmemcpy(*dst, src, length + 1);
    return *dst;
}

wchar_t* getFullPathName(const wchar_t* dir, const wchar_t* name) {
    if (dir == nullptr || name == nullptr) return nullptr;
    const wchar_t separator = utils::PathSeparator;
    size_t dirLength = std::wcslen(dir);
    size_t nameLength = std::wcslen(name);
    bool addSeparator = dirLength == 0 || dir[dirLength - 1] != separator;
    wchar_t* full = allocWide(dirLength + (addSeparator ? 1 : 0) + nameLength + 1);
    if (full == nullptr) return nullptr;
    std::wmemcpy(full, dir, dirLength);
    size_t at = dirLength;
    if (addSeparator) full[at++] = separator;
    std::wmemcpy(full + at, name, nameLength + 1);
    return full;
}

bool fullPath2Component(wchar_t* path, wchar_t sep, wchar_t** dir, wchar_t** name) {
    if (dir != nullptr) *dir = nullptr;
    if (name != nullptr) *name = nullptr;
    if (path == nullptr || dir == nullptr || name == nullptr) return false;
    const wchar_t* last = std::wcsrchr(path, sep);
    if (last == nullptr || sep == L'\0') return false;
    size_t dirLength = static_cast<size_t>(last - path);
    *dir = dupWide(path, dirLength);
    *name = dupWide(last + 1, std::wcslen(last + 1));
    if (*dir == nullptr || *name == nullptr) {
        kelm_free(*dir);
        kelm_free(*name);
        *dir = nullptr;
        *name = nullptr;
        return false;
    }
    return true;
}

wchar_t* insertAndReplaceString(const wchar_t* text, const wchar_t* find, const wchar_t* replace) {
    if (text == nullptr || find == nullptr || replace == nullptr) return nullptr;
    size_t findLength = std::wcslen(find);
    if (findLength == 0) return dupWide(text, std::wcslen(text));
    size_t replaceLength = std::wcslen(replace);
    std::wstring result;
    const wchar_t* p = text;
    for (;;) {
        const wchar_t* hit = my_wcswcs(p, find);
        if (hit == nullptr) break;
        result.append(p, static_cast<size_t>(hit - p));
        result.append(replace, replaceLength);
        p = hit + findLength;
    }
    result.append(p);
    return dupWide(result.c_str(), result.size());
}

int wcs_stringCat(wchar_t* prefix, wchar_t* buffer, unsigned int size) {
    if (prefix == nullptr || buffer == nullptr) return 0;
    size_t prefixLength = std::wcslen(prefix);
    size_t bufferLength = std::wcslen(buffer);
    if (prefixLength + bufferLength + 4 > size) return 0;
    std::wmemmove(buffer + prefixLength, buffer, bufferLength + 1);
    std::wmemcpy(buffer, prefix, prefixLength);
    return 1;
}

uint32_t elapsedTime(timeval start, timeval end) {
    long long ms = (static_cast<long long>(end.tv_sec) - static_cast<long long>(start.tv_sec)) * 1000LL +
                   (static_cast<long long>(end.tv_usec) - static_cast<long long>(start.tv_usec)) / 1000LL;
    return static_cast<uint32_t>(ms);
}

int renameFile(wchar_t* from, wchar_t* to) {
    char* narrowFrom = narrowName(from);
    char* narrowTo = narrowName(to);
    int result = -1;
    if (narrowFrom != nullptr && narrowTo != nullptr)
        result = fscanner::Env::Current()->renameFile(narrowFrom, narrowTo);
    delete[] narrowFrom;
    delete[] narrowTo;
    return result == 0 ? 0 : -1;
}

int removeFile(wchar_t* name) {
    char* narrow = narrowName(name);
    int result = -1;
    if (narrow != nullptr) {
        // remove(3): a file, else an empty directory.
        fscanner::Env* env = fscanner::Env::Current();
        result = env->removeFile(narrow);
        if (result != 0 && errno == EISDIR) result = env->removeDirectory(narrow);
    }
    delete[] narrow;
    return result == 0 ? 0 : -1;
}

char* getTempFile_Default(char* prefix) {
    fscanner::Env* env = fscanner::Env::Current();
    char name[4096];
    for (unsigned long long i = 0;; ++i) {
        if (prefix != nullptr) {
            std::snprintf(name, sizeof(name), "./%s%llu", prefix, i);
        } else {
            std::snprintf(name, sizeof(name), "./kel_%llu", i);
        }
        // Created exclusively: a name another process takes at the same
        // moment fails here and the next number is tried, so no two callers
        // ever share a file.
        int fd = env->openFile(name, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
        if (fd == -1) continue;
        env->closeFile(fd);
        size_t length = std::strlen(name);
        char* copy = new char[length + 1];
        std::memcpy(copy, name, length + 1);
        return copy;
    }
}

char debugFile[4096] = "./fscanner_debug.log";

namespace {
bool debugOn = false;
}

void startDebug() { debugOn = true; }

void startDebug(const char* name) {
    if (name != nullptr) {
        std::strncpy(debugFile, name, sizeof(debugFile) - 1);
        debugFile[sizeof(debugFile) - 1] = '\0';
    }
    debugOn = true;
}

void stopDebug() { debugOn = false; }

void debug(const char* format, ...) {
    if (!debugOn || format == nullptr) return;
    fscanner::Env* env = fscanner::Env::Current();
    FILE* file = env->openStream(debugFile, "a");
    if (file == nullptr) return;
    va_list args;
    va_start(args, format);
    std::vfprintf(file, format, args);
    va_end(args);
    env->closeStream(file);
}

namespace {

const wchar_t* tokenPosition = nullptr;

bool isTokenBlank(wchar_t c) { return c == L' ' || c == L'\t'; }

bool isSingleToken(wchar_t c) {
    return c == L'(' || c == L')' || c == L'&' || c == L'|' || c == L'!';
}

}  // namespace

int tokenize(const wchar_t* text, wchar_t* token, unsigned int size) {
    if (text != nullptr) tokenPosition = text;
    if (token == nullptr) return 0;
    std::memset(token, 0, size);
    // Room for characters, the end mark excluded.
    size_t room = size / sizeof(wchar_t);
    room = room > 0 ? room - 1 : 0;
    if (tokenPosition == nullptr) return size >= sizeof(wchar_t) ? 1 : 0;

    const wchar_t* p = tokenPosition;
    while (isTokenBlank(*p)) ++p;
    const wchar_t* start = p;
    size_t length = 0;
    bool overflow = false;
    auto put = [&](wchar_t c) {
        if (length >= room) {
            overflow = true;
            return;
        }
        token[length++] = c;
    };

    if (*p != L'\0' && isSingleToken(*p)) {
        put(*p);
        ++p;
    } else {
        while (*p != L'\0' && !isSingleToken(*p) && !overflow) {
            if (*p == L'"') {
                ++p;
                while (*p != L'\0' && *p != L'"' && !overflow) put(*p++);
                if (*p == L'"') ++p;
            } else if (isTokenBlank(*p)) {
                ++p;
            } else {
                put(*p++);
            }
        }
    }
    if (overflow || (size < sizeof(wchar_t))) {
        if (size > 0) std::memset(token, 0, size);
        tokenPosition = start;
        return 0;
    }
    tokenPosition = p;
    return 1;
}

namespace utils {

unsigned int stringToUTF8(unsigned char* out, unsigned int size, const wchar_t* in) {
    if (out == nullptr || size == 0) return 0;
    unsigned int usable = size - 1;
    unsigned int written = 0;
    unsigned int characters = 0;
    if (in != nullptr) {
        for (const wchar_t* p = in; *p != L'\0' && written < usable; ++p) {
            uint32_t c = static_cast<uint32_t>(*p);
            unsigned int left = usable - written;
            if (c < 0x80) {
                out[written++] = static_cast<unsigned char>(c);
            } else if (c < 0x800) {
                if (left <= 2) continue;
                out[written++] = static_cast<unsigned char>(0xC0 | (c >> 6));
                out[written++] = static_cast<unsigned char>(0x80 | (c & 0x3F));
            } else if (c < 0x10000) {
                if (left <= 3) continue;
                out[written++] = static_cast<unsigned char>(0xE0 | (c >> 12));
                out[written++] = static_cast<unsigned char>(0x80 | ((c >> 6) & 0x3F));
                out[written++] = static_cast<unsigned char>(0x80 | (c & 0x3F));
            } else if (c < 0x110000) {
                if (left <= 4) continue;
                out[written++] = static_cast<unsigned char>(0xF0 | (c >> 18));
                out[written++] = static_cast<unsigned char>(0x80 | ((c >> 12) & 0x3F));
                out[written++] = static_cast<unsigned char>(0x80 | ((c >> 6) & 0x3F));
                out[written++] = static_cast<unsigned char>(0x80 | (c & 0x3F));
            } else {
                out[written++] = '?';
            }
            ++characters;
        }
    }
    out[written] = '\0';
    return characters;
}

unsigned int stringToUTF8(DynamicBuffer<unsigned char>& buffer, const wchar_t* in) {
    size_t length = in != nullptr ? std::wcslen(in) : 0;
    unsigned long long wanted = 6ULL * length + 1;
    if (wanted > 0xFFFFFFFFULL || !buffer.ensure(static_cast<unsigned int>(wanted))) {
        getQvLogFs()->traceMIN(__LINE__, __FILE__, __FUNCTION__,
                               "utils::stringToUTF8 - cannot grow the buffer to %llu bytes\n", wanted);
        return 0;
    }
    return stringToUTF8(buffer.get(), buffer.capacity(), in);
}

unsigned int utf8ToWideChar(wchar_t* out, unsigned int size, const unsigned char* in) {
    if (out == nullptr || size == 0) return 0;
    unsigned int count = 0;
    if (in != nullptr) {
        const unsigned char* p = in;
        while (*p != 0 && count < size - 1) {
            unsigned char lead = *p++;
            uint32_t value;
            if (lead < 0x80) {
                value = lead;
            } else if (lead < 0xC0) {
                value = lead & 0x3F;
            } else {
                int extra = 0;
                unsigned int mask = 0x20;
                while (mask != 0 && (lead & mask) != 0) {
                    ++extra;
                    mask >>= 1;
                }
                if (mask != 0) ++extra;  // the first clear bit takes one byte too
                value = lead & (mask != 0 ? mask - 1 : 0);
                bool cut = false;
                for (int i = 0; i < extra; ++i) {
                    // Continuation bytes are taken unchecked, but never past
                    // the end of the text.
                    if (*p == 0) {
                        cut = true;
                        break;
                    }
                    value = (value << 6) | (*p++ & 0x3F);
                }
                if (cut) {
                    getQvLogFs()->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                                           "utils::utf8ToWideChar - sequence cut by the end of the text\n");
                    break;
                }
            }
            out[count++] = static_cast<wchar_t>(value);
        }
    }
    out[count] = L'\0';
    return count;
}

namespace {

int formatUtc(long time, char* buffer, unsigned int size, const char* format) {
    if (buffer == nullptr || size == 0) return -1;
    std::memset(buffer, 0, size);
    time_t t = static_cast<time_t>(time);
    struct tm parts;
    if (gmtime_r(&t, &parts) == nullptr) return -1;
    std::strftime(buffer, size, format, &parts);
    return 0;
}

}  // namespace

int timeToFIF(long time, char* buffer, unsigned int size) {
    return formatUtc(time, buffer, size, "%Y-%m-%d,%H:%M:%S");
}

int timeToXML(long time, char* buffer, unsigned int size) {
    return formatUtc(time, buffer, size, "%Y-%m-%dT%H:%M:%S");
}

int timeToMIF(long time, char* buffer, unsigned int size) {
    return formatUtc(time, buffer, size, "%Y-%m-%d-%H:%M:%S.000000");
}

int timeToSig(long time, char* buffer, unsigned int size) {
    char stamp[32];
    if (formatUtc(time, stamp, sizeof(stamp), "%Y%m%d%H%M%S") != 0) return -1;
    if (buffer == nullptr || size == 0) return -1;
    std::memset(buffer, 0, size);
    struct tm epoch;
    std::memset(&epoch, 0, sizeof(epoch));
    epoch.tm_year = 70;
    epoch.tm_mon = 0;
    epoch.tm_mday = 1;
    time_t localEpoch = std::mktime(&epoch);
    double seconds = std::difftime(static_cast<time_t>(time), localEpoch);
    // The whole seconds reach "%u" as a double.  On the 32-bit target printf
    // then reads the low word of the double's image; reproduce that word.
    double whole = static_cast<double>(static_cast<long long>(seconds));
    uint64_t image;
    std::memcpy(&image, &whole, sizeof(image));
    unsigned int lowWord = static_cast<unsigned int>(image & 0xFFFFFFFFULL);
    std::snprintf(buffer, size, "%s_%u", stamp, lowWord);
    return 0;
}

std::string getLocalDatetimeXML() {
    time_t now = std::time(nullptr);
    struct tm parts;
    if (localtime_r(&now, &parts) == nullptr) return std::string();
    char text[64];
    size_t length = std::strftime(text, sizeof(text), "%Y-%m-%dT%H:%M:%S", &parts);
    if (length == 0) return std::string();
    return std::string(text, length);
}

wchar_t* wcsdup2(const wchar_t* s) {
    if (s == nullptr) return nullptr;
    size_t length = std::wcslen(s);
    wchar_t* copy = static_cast<wchar_t*>(std::malloc((length + 1) * sizeof(wchar_t)));
    if (copy == nullptr) return nullptr;
    std::wmemcpy(copy, s, length + 1);
    return copy;
}

namespace {

bool isSpaceNarrow(char c) { return std::isspace(static_cast<unsigned char>(c)) != 0; }
bool isSpaceWide(wchar_t c) { return std::iswspace(static_cast<wint_t>(c)) != 0; }

// The in-place set: tab, line feed, vertical tab, form feed, carriage return, blank.
template <typename Char>
bool isTrimSet(Char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\v' || c == '\f' || c == '\r';
}

template <typename Str, typename Pred>
Str trimLeftCopy(const Str& s, Pred space) {
    size_t i = 0;
    while (i < s.size() && space(s[i])) ++i;
    return s.substr(i);
}

template <typename Str, typename Pred>
Str trimRightCopy(const Str& s, Pred space) {
    size_t n = s.size();
    while (n > 0 && space(s[n - 1])) --n;
    return s.substr(0, n);
}

template <typename Str>
Str& trimLeftString(Str& s) {
    size_t i = 0;
    while (i < s.size() && isTrimSet(s[i])) ++i;
    s.erase(0, i);
    return s;
}

template <typename Str>
Str& trimRightString(Str& s) {
    size_t n = s.size();
    while (n > 0 && isTrimSet(s[n - 1])) --n;
    s.erase(n);
    return s;
}

template <typename Char>
size_t textLength(const Char* s) {
    size_t n = 0;
    while (s[n] != 0) ++n;
    return n;
}

template <typename Char>
Char* trimLeftPointer(Char* s) {
    if (s == nullptr) return s;
    size_t i = 0;
    while (s[i] != 0 && isTrimSet(s[i])) ++i;
    if (i > 0) std::memmove(s, s + i, (textLength(s + i) + 1) * sizeof(Char));
    return s;
}

template <typename Char>
Char* trimRightPointer(Char* s) {
    if (s == nullptr) return s;
    size_t n = textLength(s);
    while (n > 0 && isTrimSet(s[n - 1])) s[--n] = 0;
    return s;
}

}  // namespace

std::string trimLeft(const std::string& s) { return trimLeftCopy(s, isSpaceNarrow); }
std::string trimRight(const std::string& s) { return trimRightCopy(s, isSpaceNarrow); }
std::string trimBoth(const std::string& s) { return trimLeft(trimRight(s)); }
std::wstring trimLeft(const std::wstring& s) { return trimLeftCopy(s, isSpaceWide); }
std::wstring trimRight(const std::wstring& s) { return trimRightCopy(s, isSpaceWide); }
std::wstring trimBoth(const std::wstring& s) { return trimLeft(trimRight(s)); }

std::string& trimLeftInPlace(std::string& s) { return trimLeftString(s); }
std::string& trimRightInPlace(std::string& s) { return trimRightString(s); }
std::string& trimBothInPlace(std::string& s) { return trimLeftString(trimRightString(s)); }
std::wstring& trimLeftInPlace(std::wstring& s) { return trimLeftString(s); }
std::wstring& trimRightInPlace(std::wstring& s) { return trimRightString(s); }
std::wstring& trimBothInPlace(std::wstring& s) { return trimLeftString(trimRightString(s)); }
char* trimLeftInPlace(char* s) { return trimLeftPointer(s); }
char* trimRightInPlace(char* s) { return trimRightPointer(s); }
char* trimBothInPlace(char* s) { return trimLeftPointer(trimRightPointer(s)); }
wchar_t* trimLeftInPlace(wchar_t* s) { return trimLeftPointer(s); }
wchar_t* trimRightInPlace(wchar_t* s) { return trimRightPointer(s); }
wchar_t* trimBothInPlace(wchar_t* s) { return trimLeftPointer(trimRightPointer(s)); }

bool startsWith(const std::string& a, const std::string& b) {
    if (b.size() > a.size()) return false;
    return a.compare(0, b.size(), b) == 0;
}

bool endsWith(const std::string& a, const std::string& b) {
    if (b.size() > a.size()) return false;
    return a.compare(a.size() - b.size(), b.size(), b) == 0;
}

std::string formatString(const std::string& format, ...) {
    va_list args;
    va_start(args, format);
    va_list measure;
    va_copy(measure, args);
    int length = std::vsnprintf(nullptr, 0, format.c_str(), measure);
    va_end(measure);
    std::string result;
    if (length > 0) {
        std::vector<char> text(static_cast<size_t>(length) + 1);
        std::vsnprintf(text.data(), text.size(), format.c_str(), args);
        result.assign(text.data(), static_cast<size_t>(length));
    }
    va_end(args);
    return result;
}

std::vector<std::string> split(const std::string& text, std::string delimiters) {
    std::vector<std::string> tokens;
    size_t start = text.find_first_not_of(delimiters);
    while (start != std::string::npos) {
        size_t end = text.find_first_of(delimiters, start);
        if (end == std::string::npos) {
            tokens.push_back(text.substr(start));
            break;
        }
        tokens.push_back(text.substr(start, end - start));
        start = text.find_first_not_of(delimiters, end);
    }
    return tokens;
}

int matchString(const char* regex, const char* text, std::string& out) {
    out.clear();
    if (regex == nullptr) return 4;
    regex_t compiled;
    if (regcomp(&compiled, regex, REG_EXTENDED) != 0) return 4;
    if (text == nullptr) {
        regfree(&compiled);
        return 1;
    }
    regmatch_t groups[2];
    int result = 1;
    if (regexec(&compiled, text, 2, groups, 0) == 0) {
        result = 0;
        if (compiled.re_nsub >= 1 && groups[1].rm_so >= 0 && groups[1].rm_eo >= groups[1].rm_so) {
            out.assign(text + groups[1].rm_so, static_cast<size_t>(groups[1].rm_eo - groups[1].rm_so));
        }
    }
    regfree(&compiled);
    return result;
}

std::string printArgList(int argc, char** argv) {
    std::string line;
    if (argv == nullptr) return line;
    for (int i = 0; i < argc; ++i) {
        if (i > 0) line += ' ';
        if (argv[i] != nullptr) line += argv[i];
    }
    return line;
}

std::wstring printWArgList(int argc, wchar_t** argv) {
    std::wstring line;
    if (argv == nullptr) return line;
    for (int i = 0; i < argc; ++i) {
        if (i > 0) line += L' ';
        if (argv[i] != nullptr) line += argv[i];
    }
    return line;
}

time_t getCurrentEpochTimeSeconds() { return std::time(nullptr); }

}  // namespace utils
