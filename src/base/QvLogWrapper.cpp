#include "base/QvLogWrapper.h"

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <mutex>

#include "base/KelCfg.h"

namespace {

void appendUtf8(std::string& out, uint32_t c) {
    if (c < 0x80) {
        out += static_cast<char>(c);
    } else if (c < 0x800) {
        out += static_cast<char>(0xC0 | (c >> 6));
        out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x10000) {
        out += static_cast<char>(0xE0 | (c >> 12));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
    } else if (c < 0x110000) {
        out += static_cast<char>(0xF0 | (c >> 18));
        out += static_cast<char>(0x80 | ((c >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((c >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (c & 0x3F));
    } else {
        out += '?';
    }
}

// Formats one conversion with snprintf into out.
template <typename T>
void formatOne(std::string& out, const std::string& conversion, T value) {
    char small[128];
    int n = std::snprintf(small, sizeof small, conversion.c_str(), value);
    if (n < 0) return;
    if (static_cast<size_t>(n) < sizeof small) {
        out.append(small, static_cast<size_t>(n));
        return;
    }
    std::string big(static_cast<size_t>(n) + 1, '\0');
    std::snprintf(&big[0], big.size(), conversion.c_str(), value);
    out.append(big.data(), static_cast<size_t>(n));
}

// vsnprintf with one difference: wide strings and characters (%S, %ls, %C,
// %lc) are written as UTF-8 instead of through the locale, so a trace never
// fails on a name the C locale cannot convert.
std::string formatArgs(const char* fmt, va_list ap) {
    std::string out;
    if (fmt == nullptr) return out;
    const char* p = fmt;
    while (*p != '\0') {
        if (*p != '%') {
            out += *p++;
            continue;
        }
        const char* start = p++;
        if (*p == '%') {
            out += '%';
            ++p;
            continue;
        }
        std::string flags;
        while (*p != '\0' && std::strchr("-+ #0'", *p) != nullptr) flags += *p++;
        std::string width;
        if (*p == '*') {
            width = std::to_string(va_arg(ap, int));
            ++p;
        } else {
            while (*p >= '0' && *p <= '9') width += *p++;
        }
        std::string precision;
        bool hasPrecision = false;
        if (*p == '.') {
            hasPrecision = true;
            ++p;
            if (*p == '*') {
                precision = std::to_string(va_arg(ap, int));
                ++p;
            } else {
                while (*p >= '0' && *p <= '9') precision += *p++;
            }
        }
        std::string length;
        while (*p != '\0' && std::strchr("hlLqjzt", *p) != nullptr) length += *p++;
        char conv = *p;
        if (conv == '\0') {
            out.append(start);
            break;
        }
        ++p;
        std::string base = "%" + flags + width + (hasPrecision ? "." + precision : std::string());
        switch (conv) {
            case 'd':
            case 'i':
                if (length == "l")
                    formatOne(out, base + "l" + conv, va_arg(ap, long));
                else if (length == "ll" || length == "q" || length == "L")
                    formatOne(out, base + "ll" + conv, va_arg(ap, long long));
                else if (length == "j")
                    formatOne(out, base + "j" + conv, va_arg(ap, intmax_t));
                else if (length == "z")
                    formatOne(out, base + "z" + conv, va_arg(ap, ssize_t));
                else if (length == "t")
                    formatOne(out, base + "t" + conv, va_arg(ap, ptrdiff_t));
                else
                    formatOne(out, base + length + conv, va_arg(ap, int));
                break;
            case 'u':
            case 'o':
            case 'x':
            case 'X':
                if (length == "l")
                    formatOne(out, base + "l" + conv, va_arg(ap, unsigned long));
                else if (length == "ll" || length == "q" || length == "L")
                    formatOne(out, base + "ll" + conv, va_arg(ap, unsigned long long));
                else if (length == "j")
                    formatOne(out, base + "j" + conv, va_arg(ap, uintmax_t));
                else if (length == "z")
                    formatOne(out, base + "z" + conv, va_arg(ap, size_t));
                else if (length == "t")
                    formatOne(out, base + "t" + conv, va_arg(ap, ptrdiff_t));
                else
                    formatOne(out, base + length + conv, va_arg(ap, unsigned int));
                break;
            case 'f':
            case 'F':
            case 'e':
            case 'E':
            case 'g':
            case 'G':
            case 'a':
            case 'A':
                if (length == "L")
                    formatOne(out, base + "L" + conv, va_arg(ap, long double));
                else
                    formatOne(out, base + conv, va_arg(ap, double));
                break;
            case 'p':
                formatOne(out, base + conv, va_arg(ap, void*));
                break;
            case 'n':
                (void)va_arg(ap, void*);
                break;
            case 'c':
            case 'C':
                if (conv == 'C' || length == "l") {
                    std::string one;
                    appendUtf8(one, static_cast<uint32_t>(va_arg(ap, wint_t)));
                    formatOne(out, "%" + flags + width + "s", one.c_str());
                } else {
                    formatOne(out, base + "c", va_arg(ap, int));
                }
                break;
            case 's':
            case 'S':
                if (conv == 'S' || length == "l") {
                    const wchar_t* w = va_arg(ap, const wchar_t*);
                    std::string text;
                    if (w == nullptr) {
                        text = "(null)";
                    } else {
                        size_t limit = hasPrecision ? std::strtoul(precision.c_str(), nullptr, 10)
                                                    : static_cast<size_t>(-1);
                        for (; *w != L'\0'; ++w) {
                            std::string one;
                            appendUtf8(one, static_cast<uint32_t>(*w));
                            if (text.size() + one.size() > limit) break;
                            text += one;
                        }
                    }
                    formatOne(out, "%" + flags + width + "s", text.c_str());
                } else {
                    const char* s = va_arg(ap, const char*);
                    formatOne(out, base + "s", s != nullptr ? s : "(null)");
                }
                break;
            default:
                // Unknown conversion: keep the text as written.
                out.append(start, static_cast<size_t>(p - start));
                break;
        }
    }
    return out;
}

const char* levelLetter(int level) {
    switch (level) {
        case QvLogWrapper::LEVEL_MIN:
            return "1";
        case QvLogWrapper::LEVEL_MID:
            return "2";
        default:
            return "3";
    }
}

}  // namespace

struct QvLogWrapper::Impl {
    std::mutex lock;
    bool configured = false;
    int level = LEVEL_OFF;
    FILE* out = nullptr;  // null: standard error
    bool capturing = false;
    int captureLevel = LEVEL_MAX;
    std::vector<Message> messages;
    // The highest level that is written or captured, once configured, kept
    // beside the fields it follows from (under lock, by settle): a trace
    // above it is answered without the lock.  Most trace calls of a query
    // are such, one or more a row read.
    static constexpr int UNSETTLED = LEVEL_MAX + 1;
    std::atomic<int> active{UNSETTLED};

    void settle() {
        int highest = level;
        if (capturing && captureLevel > highest) highest = captureLevel;
        active.store(configured ? highest : UNSETTLED, std::memory_order_relaxed);
    }

    void configureFromEnvironment() {
        if (configured) return;
        configured = true;
        std::string levelText, file;
        if (const char* e = std::getenv("FSCANNER_TRACE_LEVEL")) levelText = e;
        if (const char* e = std::getenv("FSCANNER_TRACE_FILE")) file = e;
        if (levelText.empty()) levelText = static_cast<const char*>(KelCfg::getKey("trace_level"));
        if (file.empty()) file = static_cast<const char*>(KelCfg::getKey("trace_file"));
        level = levelText.empty() ? LEVEL_OFF : std::atoi(levelText.c_str());
        if (level < LEVEL_OFF) level = LEVEL_OFF;
        if (level > LEVEL_MAX) level = LEVEL_MAX;
        if (!file.empty()) out = std::fopen(file.c_str(), "a");
        settle();
    }
};

QvLogWrapper::QvLogWrapper() : impl_(new Impl) {}

QvLogWrapper::~QvLogWrapper() {
    if (impl_->out != nullptr) std::fclose(impl_->out);
    delete impl_;
}

bool QvLogWrapper::configure(int level, const char* file) {
    std::lock_guard<std::mutex> g(impl_->lock);
    impl_->configured = true;
    impl_->level = level < LEVEL_OFF ? LEVEL_OFF : (level > LEVEL_MAX ? LEVEL_MAX : level);
    impl_->settle();
    if (impl_->out != nullptr) std::fclose(impl_->out);
    impl_->out = nullptr;
    if (file != nullptr && *file != '\0') {
        impl_->out = std::fopen(file, "a");
        if (impl_->out == nullptr) return false;
    }
    return true;
}

int QvLogWrapper::level() {
    std::lock_guard<std::mutex> g(impl_->lock);
    impl_->configureFromEnvironment();
    return impl_->level;
}

namespace {
// Set by silenceForSignal; read before any lock is taken.
std::atomic<bool> gSilenced(false);
static_assert(std::atomic<bool>::is_always_lock_free, "a signal handler sets it");
}  // namespace

void QvLogWrapper::silenceForSignal() { gSilenced.store(true, std::memory_order_relaxed); }

bool QvLogWrapper::istraceActive(int level) {
    if (gSilenced.load(std::memory_order_relaxed)) return false;
    if (level > impl_->active.load(std::memory_order_relaxed)) return false;
    std::lock_guard<std::mutex> g(impl_->lock);
    impl_->configureFromEnvironment();
    if (level <= LEVEL_OFF) return false;
    return level <= impl_->level || (impl_->capturing && level <= impl_->captureLevel);
}

void QvLogWrapper::startCapture(int maxLevel) {
    std::lock_guard<std::mutex> g(impl_->lock);
    impl_->capturing = true;
    impl_->captureLevel = maxLevel;
    impl_->settle();
    impl_->messages.clear();
}

std::vector<QvLogWrapper::Message> QvLogWrapper::stopCapture() {
    std::lock_guard<std::mutex> g(impl_->lock);
    impl_->capturing = false;
    impl_->settle();
    std::vector<Message> result;
    result.swap(impl_->messages);
    return result;
}

std::vector<QvLogWrapper::Message> QvLogWrapper::captured() {
    std::lock_guard<std::mutex> g(impl_->lock);
    return impl_->messages;
}

void QvLogWrapper::emit(int level, int line, const char* file, const char* function,
                        const char* fmt, va_list args) {
    if (!istraceActive(level)) return;  // false once silenced, before any lock
    std::string text = formatArgs(fmt, args);
    std::lock_guard<std::mutex> g(impl_->lock);
    if (impl_->capturing && level <= impl_->captureLevel) impl_->messages.push_back({level, text});
    if (level <= impl_->level) {
        FILE* out = impl_->out != nullptr ? impl_->out : stderr;
        const char* base = file != nullptr ? std::strrchr(file, '/') : nullptr;
        base = base != nullptr ? base + 1 : (file != nullptr ? file : "?");
        std::fprintf(out, "%s %s:%d %s: %s", levelLetter(level), base, line,
                     function != nullptr ? function : "?", text.c_str());
        if (text.empty() || text.back() != '\n') std::fputc('\n', out);
        std::fflush(out);
    }
}

#define QVLOG_FORWARD(NAME, LEVEL)                                                            \
    void QvLogWrapper::NAME(int line, const char* file, const char* function, const char* fmt, \
                            ...) {                                                            \
        va_list args;                                                                         \
        va_start(args, fmt);                                                                  \
        emit(LEVEL, line, file, function, fmt, args);                                         \
        va_end(args);                                                                         \
    }

QVLOG_FORWARD(traceMIN, LEVEL_MIN)
QVLOG_FORWARD(traceMID, LEVEL_MID)
QVLOG_FORWARD(traceMAX, LEVEL_MAX)
QVLOG_FORWARD(traceMidEntry, LEVEL_MID)
QVLOG_FORWARD(traceMidExit, LEVEL_MID)

#undef QVLOG_FORWARD

std::string QvLogWrapper::format(const char* fmt, ...) {
    va_list args;
    va_start(args, fmt);
    std::string text = formatArgs(fmt, args);
    va_end(args);
    return text;
}

QvLogWrapper* getQvLogFs() {
    // Never destroyed, so that traces from static destructors stay safe.
    static QvLogWrapper* handle = new QvLogWrapper;
    return handle;
}
