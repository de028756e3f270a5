// Tracing handle of the host.
//
// getQvLogFs() gives the one process-wide handle.  Each trace operation takes
// the source line, source file, function name, a printf format and its
// arguments; "%S" and "%ls" take wide strings, which are written as UTF-8
// whatever the locale.  A message goes out when its level is at or below the
// current level: traceMIN is level 1, traceMID (and traceMidEntry,
// traceMidExit) level 2, traceMAX level 3.  Level 0 means off, the default.
//
// The level and the output come, on first use, from the environment
// (FSCANNER_TRACE_LEVEL, FSCANNER_TRACE_FILE) or else from the configuration
// keys "trace_level" and "trace_file"; with no file the output is standard
// error.  Each written line is "<level letter> <file>:<line> <function>: text".
//
// A capture sink (see TraceCapture) receives every message regardless of the
// level while it is installed, so tests can read what was traced.  All
// operations are thread-safe.
#ifndef FSCANNER_BASE_QVLOGWRAPPER_H
#define FSCANNER_BASE_QVLOGWRAPPER_H

#include <cstdarg>
#include <string>
#include <vector>

class QvLogWrapper {
public:
    enum Level { LEVEL_OFF = 0, LEVEL_MIN = 1, LEVEL_MID = 2, LEVEL_MAX = 3 };

    void traceMIN(int line, const char* file, const char* function, const char* format, ...)
        __attribute__((format(printf, 5, 6)));
    void traceMID(int line, const char* file, const char* function, const char* format, ...)
        __attribute__((format(printf, 5, 6)));
    void traceMAX(int line, const char* file, const char* function, const char* format, ...)
        __attribute__((format(printf, 5, 6)));
    void traceMidEntry(int line, const char* file, const char* function, const char* format, ...)
        __attribute__((format(printf, 5, 6)));
    void traceMidExit(int line, const char* file, const char* function, const char* format, ...)
        __attribute__((format(printf, 5, 6)));

    // True when a message of this level would be written or captured.
    bool istraceActive(int level);

    // Sets the level (0..3) and the output file (null or empty: standard
    // error).  Returns false when the file cannot be opened; output then goes
    // to standard error.
    bool configure(int level, const char* file);
    int level();

    // One captured message: its level and the formatted text (no prefix).
    struct Message {
        int level;
        std::string text;
    };
    // Starts capturing; every message at or below maxLevel is kept from now on.
    void startCapture(int maxLevel = LEVEL_MAX);
    // Stops capturing and returns what was captured.
    std::vector<Message> stopCapture();
    // A copy of what has been captured so far, capture going on.
    std::vector<Message> captured();

    QvLogWrapper();
    ~QvLogWrapper();
    QvLogWrapper(const QvLogWrapper&) = delete;
    QvLogWrapper& operator=(const QvLogWrapper&) = delete;

    // Ends all tracing of the process, for good: every trace operation
    // returns at once from then on, without taking the lock or memory.  For
    // a signal handler that runs cleanup code before the process ends: the
    // code it interrupted may hold the trace lock (writing a line) or be
    // inside the allocator, and a trace in the handler would wait for ever.
    // Async-signal-safe.
    static void silenceForSignal();

    // Formats like vsnprintf, with %S and %ls written as UTF-8.  Exposed for
    // tests of the formatter.
    static std::string format(const char* format, ...) __attribute__((format(printf, 1, 2)));

private:
    void emit(int level, int line, const char* file, const char* function, const char* format,
              va_list args);
    struct Impl;
    Impl* impl_;
};

QvLogWrapper* getQvLogFs();

#endif
