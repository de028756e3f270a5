// fsquery: the command-line host of the library.
//
//   fsquery [OPTIONS] [PATH...]
//
// Runs one query through FS_Cache (or FS_Cache2 when caching masks are given)
// on a cache directory that persists between runs, and prints the hits.  With
// --no-cache the same paths are resolved the same way and walked directly with
// fs_build.  Run `fsquery --help` for the options and the exit codes.
//
// What the tool writes: its output, the cache directory (tables, marks, lock
// files, the engine's list of scanned folders and the temporary file of a
// sorted result) and, when asked, a trace file.  Nothing else: LinuxSharedMutex::storePath is pointed at the cache
// directory before any lock object exists, and the result file of --sort takes
// its name from the cache directory too.
//
// Layout of the cache directory: one subdirectory per kind of cache, so that
// caches that hold different things never answer for one another:
//   all[+sums]           FS_Cache, every file; "+sums" when checksums are kept
//   sel-<hash>[+sums]    FS_Cache2 for one set of caching masks
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cctype>
#include <cerrno>
#include <chrono>
#include <climits>
#include <clocale>
#include <condition_variable>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

#include "base/CpuThreshold.h"
#include "base/KelCfg.h"
#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_loader.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

const char kVersion[] = "0.1.0";

// Exit codes.  Every negative result of the engine has its own.
enum ExitCode {
    EXIT_OK = 0,                 // done, with hits or without
    EXIT_FAILED = 1,             // the tool itself failed (cache directory, output, trace file)
    EXIT_USAGE = 2,              // bad command line, bad expression, missing path
    EXIT_CACHE_UNUSABLE = 3,     // CACHE_UNUSABLE (-40): the cache was damaged and is removed
    EXIT_SCAN_TIMED_OUT = 4,     // SCAN_TIMED_OUT (-41): a walk or the extraction ran out of time
    EXIT_BUILD_TIMED_OUT = 5,    // BUILD_TIMED_OUT (-42): a cache build ran out of time
    EXIT_ALREADY_OPENED = 6,     // CACHE_ALREADY_OPENED (-51)
    EXIT_LOCK_TIMED_OUT = 7,     // CACHE_LOCK_TIMED_OUT (-52): another process holds the cache
    EXIT_CACHE_ERROR = 8         // CACHE_ERROR (-53): the cache could not be created or locked
};

// Budget of a query when --timeout is not given: the one the engine itself
// gives its direct walks.
const unsigned int kDefaultTimeoutMs = 2000000000u;
const unsigned int kDefaultMaxAge = 86400u;
const int kDefaultLockWaitMs = 5000;

enum Format { FORMAT_TEXT, FORMAT_JSON, FORMAT_CSV, FORMAT_NULL };

struct Options {
    std::vector<std::string> paths;
    std::vector<std::string> excludes;
    std::vector<std::string> includeFs;
    std::vector<std::string> excludeFs;
    std::vector<std::string> expressions;
    std::vector<std::string> names;
    std::vector<std::string> cacheFiles;
    std::vector<std::string> knownMd5;
    bool nonRecursive = false;
    bool ignoreCase = false;
    bool noCache = false;
    bool md5 = false;
    bool crc32 = false;
    bool q32 = false;
    bool stats = false;
    bool reverse = false;
    std::string cacheDir;
    unsigned int maxAge = kDefaultMaxAge;
    unsigned int timeoutMs = kDefaultTimeoutMs;
    int lockWaitMs = kDefaultLockWaitMs;
    std::string cpu;
    std::string provider = "fsquery";
    std::string configFile;
    std::string traceFile;
    int traceLevel = -1;
    unsigned int sortKey = 0;  // 0 none, else FsFileInfo::COMPARE_*
    Format format = FORMAT_TEXT;
    std::string mountTable;
    std::string automounterMaster;
};

// ------------------------------------------------------------ text helpers

std::wstring toWide(const std::string& text) {
    std::wstring out;
    std::mbstate_t state = std::mbstate_t();
    const char* p = text.c_str();
    const char* end = p + text.size();
    while (p < end) {
        wchar_t c;
        size_t n = std::mbrtowc(&c, p, static_cast<size_t>(end - p), &state);
        if (n == static_cast<size_t>(-1) || n == static_cast<size_t>(-2)) {
            // Not valid in this locale: keep the byte as a character of its own.
            out.push_back(static_cast<wchar_t>(static_cast<unsigned char>(*p)));
            state = std::mbstate_t();
            ++p;
            continue;
        }
        if (n == 0) break;
        out.push_back(c);
        p += n;
    }
    return out;
}

// The locale's multibyte form, which gives back the bytes the file system
// holds; a character the locale cannot write becomes "?".
void appendLocal(std::string& out, const wchar_t* text) {
    if (text == nullptr) return;
    char buffer[MB_LEN_MAX];
    std::mbstate_t state = std::mbstate_t();
    for (; *text != L'\0'; ++text) {
        if (static_cast<unsigned int>(*text) < 0x80) {
            out.push_back(static_cast<char>(*text));
            continue;
        }
        size_t n = std::wcrtomb(buffer, *text, &state);
        if (n == static_cast<size_t>(-1)) {
            out.push_back('?');
            state = std::mbstate_t();
        } else {
            out.append(buffer, n);
        }
    }
}

void appendUtf8(std::string& out, wchar_t wc) {
    uint32_t c = static_cast<uint32_t>(wc);
    if (c > 0x10ffff || (c >= 0xd800 && c <= 0xdfff)) c = 0xfffd;
    if (c < 0x80) {
        out.push_back(static_cast<char>(c));
    } else if (c < 0x800) {
        out.push_back(static_cast<char>(0xc0 | (c >> 6)));
        out.push_back(static_cast<char>(0x80 | (c & 0x3f)));
    } else if (c < 0x10000) {
        out.push_back(static_cast<char>(0xe0 | (c >> 12)));
        out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3f)));
        out.push_back(static_cast<char>(0x80 | (c & 0x3f)));
    } else {
        out.push_back(static_cast<char>(0xf0 | (c >> 18)));
        out.push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3f)));
        out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3f)));
        out.push_back(static_cast<char>(0x80 | (c & 0x3f)));
    }
}

void appendJsonString(std::string& out, const wchar_t* text) {
    if (text == nullptr) {
        out += "null";
        return;
    }
    out.push_back('"');
    for (; *text != L'\0'; ++text) {
        wchar_t c = *text;
        switch (c) {
        case L'"': out += "\\\""; break;
        case L'\\': out += "\\\\"; break;
        case L'\n': out += "\\n"; break;
        case L'\r': out += "\\r"; break;
        case L'\t': out += "\\t"; break;
        default:
            if (static_cast<uint32_t>(c) < 0x20) {
                char escape[8];
                std::snprintf(escape, sizeof escape, "\\u%04x", static_cast<unsigned int>(c));
                out += escape;
            } else {
                appendUtf8(out, c);
            }
        }
    }
    out.push_back('"');
}

void appendCsvField(std::string& out, const std::string& field) {
    if (field.find_first_of(",\"\r\n") == std::string::npos) {
        out += field;
        return;
    }
    out.push_back('"');
    for (char c : field) {
        if (c == '"') out.push_back('"');
        out.push_back(c);
    }
    out.push_back('"');
}

std::string hex8(unsigned int value) {
    char text[16];
    std::snprintf(text, sizeof text, "%08x", value);
    return text;
}

// --------------------------------------------------------- command line

void printUsage(FILE* out) {
    std::fputs(
        "usage: fsquery [OPTIONS] [PATH...]\n"
        "\n"
        "Prints the files below PATH (default: the working directory) that answer the\n"
        "query, from a cache that persists between runs.  PATH takes the library's path\n"
        "syntax: [MEDIA::][DRIVE:]PATH, e.g. /usr, $local::/usr, /usr:/usr/lib, *:/home.\n"
        "\n"
        "Selection:\n"
        "  -e EXPR               query expression, e.g. '[SIZE]>1000 && [FILENAME]==\"*.c\"'\n"
        "                        (columns FILENAME ATTR SIZE PATHID MD5 CRC32 Q32;\n"
        "                        repeatable: all of them must hold)\n"
        "  --name MASK           shorthand for [FILENAME]==\"MASK\" (repeatable: any of them)\n"
        "  --ignore-case         names and texts compare without regard to case\n"
        "  --exclude PATH        leave PATH and everything below it out (repeatable)\n"
        "  --non-recursive       report only the files directly in each PATH\n"
        "  --include-fs TYPE     only drives of this file system type (repeatable)\n"
        "  --exclude-fs TYPE     no drives of this file system type (repeatable)\n"
        "  --known-md5 HEX       only files with one of these MD5 sums (repeatable)\n"
        "\n"
        "Cache:\n"
        "  --cache DIR           cache directory (default $XDG_CACHE_HOME/fsquery,\n"
        "                        else ~/.cache/fsquery)\n"
        "  --no-cache            walk the file system directly, keep nothing\n"
        "  --cache-files MASK    keep only files matching MASK in the cache (FS_Cache2;\n"
        "                        repeatable)\n"
        "  --max-age SECONDS     rebuild a cached tree older than this (default 86400)\n"
        "  --timeout MS          time budget of the query (default 2000000000)\n"
        "  --lock-wait MS        how long to wait for another process's lock (default 5000)\n"
        "  --cpu RUN:SLEEP       throttle: run RUN ms, then sleep SLEEP ms\n"
        "  --md5, --crc32, --q32 compute and report these checksums\n"
        "  --provider NAME       provider name recorded with the cache (default fsquery);\n"
        "                        a change rebuilds the first cached tree\n"
        "  --config FILE         configuration file of key=value lines\n"
        "  --trace FILE          write the library's trace to FILE\n"
        "  --trace-level N       0 off, 1 milestones, 2 more, 3 everything\n"
        "\n"
        "Output:\n"
        "  --sort KEY            path, name, fullpath or size (through a result file)\n"
        "  --reverse             descending order (with --sort)\n"
        "  --format FORMAT       text (one path per line), json (one object per line),\n"
        "                        csv (with a header row) or null (nothing)\n"
        "  --stats               tell on standard error how the query was answered\n"
        "  --help, --version\n"
        "\n"
        "Testing:\n"
        "  --mount-table FILE    read mounts from FILE instead of /etc/mtab\n"
        "  --automounter-master FILE  read automounter maps from FILE\n"
        "\n"
        "Exit status: 0 done (with or without hits); 1 the tool failed; 2 usage error;\n"
        "3 cache unusable; 4 scan timed out; 5 build timed out; 6 cache already opened;\n"
        "7 cache locked by another process; 8 cache error.\n",
        out);
}

struct UsageError {
    std::string message;
};

bool parseUnsigned(const std::string& text, unsigned long long limit, unsigned long long& out) {
    if (text.empty() || text.size() > 20) return false;
    unsigned long long value = 0;
    for (char c : text) {
        if (c < '0' || c > '9') return false;
        unsigned long long next = value * 10 + static_cast<unsigned long long>(c - '0');
        if (next / 10 != value) return false;
        value = next;
    }
    if (value > limit) return false;
    out = value;
    return true;
}

bool isHex(const std::string& text, size_t length) {
    if (text.size() != length) return false;
    for (char c : text) {
        if (!std::isxdigit(static_cast<unsigned char>(c))) return false;
    }
    return true;
}

Options parseCommandLine(int argc, char** argv, bool& helpOrVersion) {
    Options o;
    helpOrVersion = false;
    bool onlyPaths = false;
    for (int i = 1; i < argc; ++i) {
        std::string arg = argv[i];
        if (onlyPaths || arg.empty() || arg[0] != '-' || arg == "-") {
            o.paths.push_back(arg);
            continue;
        }
        if (arg == "--") {
            onlyPaths = true;
            continue;
        }
        std::string name = arg;
        std::string value;
        bool hasInlineValue = false;
        size_t eq = arg.find('=');
        if (arg.compare(0, 2, "--") == 0 && eq != std::string::npos) {
            name = arg.substr(0, eq);
            value = arg.substr(eq + 1);
            hasInlineValue = true;
        }
        auto takeValue = [&]() -> std::string {
            if (hasInlineValue) return value;
            if (i + 1 >= argc) throw UsageError{"option '" + name + "' needs a value"};
            return argv[++i];
        };
        auto noValue = [&]() {
            if (hasInlineValue) throw UsageError{"option '" + name + "' takes no value"};
        };
        auto unsignedValue = [&](unsigned long long limit) -> unsigned long long {
            std::string text = takeValue();
            unsigned long long number = 0;
            if (!parseUnsigned(text, limit, number)) {
                throw UsageError{"option '" + name + "' needs a number from 0 to " +
                                 std::to_string(limit) + ", not '" + text + "'"};
            }
            return number;
        };

        if (name == "--help" || name == "-h") {
            noValue();
            printUsage(stdout);
            helpOrVersion = true;
            return o;
        } else if (name == "--version") {
            noValue();
            std::printf("fsquery %s\n", kVersion);
            helpOrVersion = true;
            return o;
        } else if (name == "--exclude") {
            o.excludes.push_back(takeValue());
        } else if (name == "--non-recursive") {
            noValue();
            o.nonRecursive = true;
        } else if (name == "--include-fs") {
            o.includeFs.push_back(takeValue());
        } else if (name == "--exclude-fs") {
            o.excludeFs.push_back(takeValue());
        } else if (name == "-e" || name == "--expression") {
            o.expressions.push_back(takeValue());
        } else if (name == "--name") {
            std::string mask = takeValue();
            if (mask.empty()) throw UsageError{"option '--name' needs a non-empty mask"};
            if (mask.find('"') != std::string::npos) {
                throw UsageError{"a name mask cannot hold a double quote"};
            }
            o.names.push_back(mask);
        } else if (name == "--ignore-case") {
            noValue();
            o.ignoreCase = true;
        } else if (name == "--cache") {
            o.cacheDir = takeValue();
            if (o.cacheDir.empty()) throw UsageError{"option '--cache' needs a directory"};
        } else if (name == "--no-cache") {
            noValue();
            o.noCache = true;
        } else if (name == "--cache-files") {
            std::string mask = takeValue();
            if (mask.empty()) throw UsageError{"option '--cache-files' needs a non-empty mask"};
            o.cacheFiles.push_back(mask);
        } else if (name == "--max-age") {
            o.maxAge = static_cast<unsigned int>(unsignedValue(UINT_MAX));
        } else if (name == "--timeout") {
            o.timeoutMs = static_cast<unsigned int>(unsignedValue(INT_MAX));
        } else if (name == "--lock-wait") {
            o.lockWaitMs = static_cast<int>(unsignedValue(INT_MAX));
        } else if (name == "--cpu") {
            std::string text = takeValue();
            size_t colon = text.find(':');
            unsigned long long run = 0, sleep = 0;
            if (colon == std::string::npos || !parseUnsigned(text.substr(0, colon), INT_MAX, run) ||
                !parseUnsigned(text.substr(colon + 1), INT_MAX, sleep) || run == 0) {
                throw UsageError{"option '--cpu' needs RUN:SLEEP in milliseconds, RUN above 0, not '" +
                                 text + "'"};
            }
            o.cpu = "0:0:" + std::to_string(run) + ":" + std::to_string(sleep);
        } else if (name == "--md5") {
            noValue();
            o.md5 = true;
        } else if (name == "--crc32") {
            noValue();
            o.crc32 = true;
        } else if (name == "--q32") {
            noValue();
            o.q32 = true;
        } else if (name == "--known-md5") {
            std::string hex = takeValue();
            if (!isHex(hex, 32)) throw UsageError{"'" + hex + "' is not an MD5 sum of 32 hexadecimal digits"};
            o.knownMd5.push_back(hex);
        } else if (name == "--provider") {
            o.provider = takeValue();
            if (o.provider.empty()) throw UsageError{"option '--provider' needs a name"};
        } else if (name == "--config") {
            o.configFile = takeValue();
        } else if (name == "--trace") {
            o.traceFile = takeValue();
            if (o.traceFile.empty()) throw UsageError{"option '--trace' needs a file"};
        } else if (name == "--trace-level") {
            o.traceLevel = static_cast<int>(unsignedValue(3));
        } else if (name == "--sort") {
            std::string key = takeValue();
            if (key == "path") o.sortKey = FsFileInfo::COMPARE_PATH;
            else if (key == "name") o.sortKey = FsFileInfo::COMPARE_NAME;
            else if (key == "fullpath") o.sortKey = FsFileInfo::COMPARE_FULL_PATH;
            else if (key == "size") o.sortKey = FsFileInfo::COMPARE_SIZE;
            else throw UsageError{"option '--sort' takes path, name, fullpath or size, not '" + key + "'"};
        } else if (name == "--reverse") {
            noValue();
            o.reverse = true;
        } else if (name == "--format") {
            std::string format = takeValue();
            if (format == "text") o.format = FORMAT_TEXT;
            else if (format == "json") o.format = FORMAT_JSON;
            else if (format == "csv") o.format = FORMAT_CSV;
            else if (format == "null") o.format = FORMAT_NULL;
            else throw UsageError{"option '--format' takes text, json, csv or null, not '" + format + "'"};
        } else if (name == "--stats") {
            noValue();
            o.stats = true;
        } else if (name == "--mount-table") {
            o.mountTable = takeValue();
        } else if (name == "--automounter-master") {
            o.automounterMaster = takeValue();
        } else {
            throw UsageError{"unknown option '" + name + "'"};
        }
    }
    if (o.reverse && o.sortKey == 0) throw UsageError{"option '--reverse' needs '--sort'"};
    if (o.noCache && !o.cacheFiles.empty()) {
        throw UsageError{"options '--no-cache' and '--cache-files' exclude each other"};
    }
    if (o.paths.empty()) o.paths.push_back(".");
    return o;
}

// The expression the query runs: the names (any of them) and every -e
// expression (all of them).  A lone exact name stays a plain comparison of
// FILENAME with a literal, which the engine answers through its index.
std::string buildExpression(const Options& o) {
    std::vector<std::string> parts;
    if (!o.names.empty()) {
        std::string names;
        for (size_t i = 0; i < o.names.size(); ++i) {
            if (i > 0) names += " || ";
            names += "[FILENAME]==\"" + o.names[i] + "\"";
        }
        parts.push_back(names);
    }
    for (const std::string& e : o.expressions) {
        // The language refuses blanks around an expression; a shell user
        // types them freely.
        size_t first = e.find_first_not_of(' ');
        size_t last = e.find_last_not_of(' ');
        parts.push_back(first == std::string::npos ? std::string() : e.substr(first, last - first + 1));
    }
    // Every file: no size is negative.
    if (parts.empty()) return "[SIZE]>=0";
    if (parts.size() == 1) return parts[0];
    std::string all;
    for (size_t i = 0; i < parts.size(); ++i) {
        if (i > 0) all += " && ";
        all += "(" + parts[i] + ")";
    }
    return all;
}

// ------------------------------------------------------- expression check

// Stand-ins for the two commands the engine registers, with the same
// signatures, so that a check knows their names and types.  They never run:
// the check parses with commands switched off.
class PathStub : public BinaryCmd {
public:
    int execute(ExpValue const&, ExpValue const&, ExpValue& result) override {
        result.setString(L"");
        return 0;
    }
};
class TypeStub : public BinaryCmd {
public:
    int execute(ExpValue const&, ExpValue const&, ExpValue& result) override {
        result.setNumericValue(0);
        return 0;
    }
};

struct ExpressionCheck {
    bool ok = false;
    std::string reason;      // the parser's own words when it refused
    std::string indexColumn; // column answered through an index, or empty
};

void onArithmeticFault(int) {
    static const char message[] = "fsquery: the expression divides by zero\n";
    ssize_t ignored = write(2, message, sizeof message - 1);
    (void)ignored;
    _exit(EXIT_USAGE);
}

// Parses the expression once against the columns the query will see, with
// commands switched off, so that a typing error is a usage error and not a
// silent empty answer.
ExpressionCheck checkExpression(const std::wstring& expression, bool directWalk) {
    ExpressionCheck result;
    Fields columns;
    columns.add(L"FILENAME", FIELD_TEXT);
    if (directWalk) columns.add(L"SHORTFILENAME", FIELD_TEXT);
    columns.add(L"ATTR", 3);
    columns.add(L"SIZE", 4);
    columns.add(L"PATHID", 3);
    columns.add(L"MD5", FIELD_TEXT);
    columns.add(L"CRC32", 3);
    columns.add(L"Q32", 3);
    // Values of 1, so that a division by a column does not fault here.
    for (unsigned int i = 0; i < columns.count(); ++i) {
        Field* f = columns.at(i);
        if (f->getType() == 3) static_cast<Int32Field*>(f)->value(1u);
        else if (f->getType() == 4) static_cast<Int64Field*>(f)->value(1ull);
        else if (f->getType() == FIELD_TEXT) static_cast<TextField*>(f)->value(L"x");
    }
    PathStub pathStub;
    TypeStub typeStub;
    QvLogWrapper* log = getQvLogFs();
    log->startCapture(QvLogWrapper::LEVEL_MAX);
    {
        CriteriaEvaluator evaluator(expression.c_str());
        evaluator.setFields(&columns);
        evaluator.addCmd(L"path", EXP_STRING, EXP_NUMERIC, EXP_STRING, &pathStub);
        evaluator.addCmd(L"type", EXP_NUMERIC, EXP_STRING, EXP_STRING, &typeStub);
        ExpValue* hash = evaluator.getHashInfo();
        result.ok = evaluator.isValid() && !evaluator.hasFailed();
        if (hash != nullptr && hash->hasName()) {
            std::string column;
            appendLocal(column, hash->getNValueString());
            result.indexColumn = column;
        }
    }
    std::vector<QvLogWrapper::Message> messages = log->stopCapture();
    for (const QvLogWrapper::Message& m : messages) {
        if (m.text.find("SyntaxAnalyzer::") == 0 || m.text.find("SyntaxTree::") == 0) {
            std::string text = m.text;
            size_t dash = text.find(" - ");
            if (dash != std::string::npos) text = text.substr(dash + 3);
            while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
            result.reason = text;
        }
    }
    return result;
}

// ------------------------------------------------------------- output

// Shows how far a long query has come, on a terminal only.  The count comes
// from a function polled every 200 ms; nothing is shown during the first
// second.  Output to the same terminal first wipes the progress line.
class Progress {
public:
    typedef long long (*Counter)(const void* source);

    Progress() : active(false), stop(false), shown(false) {}
    ~Progress() { finish(); }

    void start(Counter c, const void* s, std::atomic<long long>* hitCount) {
        if (!isatty(2)) return;
        counter = c;
        source = s;
        hits = hitCount;
        begin = std::chrono::steady_clock::now();
        active = true;
        worker = std::thread([this] { run(); });
    }
    void finish() {
        if (!active) return;
        {
            std::lock_guard<std::mutex> guard(lock);
            stop = true;
        }
        wake.notify_all();
        worker.join();
        active = false;
        wipe();
    }
    // Called before a line goes to standard output.
    void beforeOutput() {
        if (!shown.load(std::memory_order_relaxed)) return;
        std::lock_guard<std::mutex> guard(lock);
        wipeLocked();
    }

private:
    void run() {
        std::unique_lock<std::mutex> guard(lock);
        while (!stop) {
            wake.wait_for(guard, std::chrono::milliseconds(200));
            if (stop) break;
            double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
            if (seconds < 1.0) continue;
            char line[160];
            int n = std::snprintf(line, sizeof line, "\rfsquery: %lld entries scanned, %lld hits, %.1f s ",
                                  counter(source), hits->load(std::memory_order_relaxed), seconds);
            if (n > 0) {
                std::fflush(stdout);
                ssize_t ignored = write(2, line, static_cast<size_t>(std::min(n, 159)));
                (void)ignored;
                shown = true;
            }
        }
    }
    void wipe() {
        std::lock_guard<std::mutex> guard(lock);
        wipeLocked();
    }
    void wipeLocked() {
        if (!shown) return;
        static const char clear[] = "\r\033[K";
        ssize_t ignored = write(2, clear, sizeof clear - 1);
        (void)ignored;
        shown = false;
    }

    bool active;
    bool stop;
    std::atomic<bool> shown;
    Counter counter = nullptr;
    const void* source = nullptr;
    std::atomic<long long>* hits = nullptr;
    std::chrono::steady_clock::time_point begin;
    std::mutex lock;
    std::condition_variable wake;
    std::thread worker;
};

// Prints records as they come.  Owns nothing of the library; the caller
// keeps it alive for the query.
class Printer {
public:
    Printer(const Options& o, Progress& p, bool computeSums)
        : options(o), progress(p), fillSums(computeSums) {
        buffer.reserve(1 << 16);
    }

    void header() {
        if (options.format != FORMAT_CSV) return;
        buffer +=
            "path,name,fullPath,md5,sha256,attr,size,device,groupId,userId,iNode,"
            "lastAccessTime,createTime,lastModifyTime,linkCount,crc32,q32\n";
        flushIfFull();
    }

    // The quick form: a record that is only a path and a name.
    void print(const wchar_t* path, const wchar_t* name) {
        if (options.format == FORMAT_NULL || broken) return;
        appendLocal(buffer, path);
        if (path != nullptr && path[0] != L'\0' && path[wcslen(path) - 1] != L'/') buffer.push_back('/');
        appendLocal(buffer, name);
        buffer.push_back('\n');
        flushIfFull();
    }

    void print(FsFileInfo& info) {
        if (options.format == FORMAT_NULL || broken) return;
        if (fillSums) computeSums(info);
        std::string full;
        appendLocal(full, info.getPath());
        if (!full.empty() && full.back() != '/') full.push_back('/');
        appendLocal(full, info.getName());
        if (options.format == FORMAT_TEXT) {
            if (options.md5) buffer += narrow(info.getMD5()) + "  ";
            if (options.crc32) buffer += hex8(info.getCRC32()) + "  ";
            if (options.q32) buffer += hex8(info.getQ32()) + "  ";
            buffer += full;
            buffer.push_back('\n');
        } else if (options.format == FORMAT_JSON) {
            appendJson(info);
        } else {
            appendCsv(info, full);
        }
        flushIfFull();
    }

    // False when standard output failed for another reason than a closed
    // pipe (which ends the output quietly).
    bool finish() {
        flush();
        if (!broken && std::fflush(stdout) != 0) broken = (errno == EPIPE) ? 1 : 2;
        return broken != 2;
    }

private:
    static std::string narrow(const wchar_t* text) {
        std::string out;
        appendLocal(out, text);
        return out;
    }

    // Checksums of a hit of the direct walk, which reports none: the tool
    // computes the ones asked for.
    void computeSums(FsFileInfo& info) {
        if (info.getPath() == nullptr || info.getName() == nullptr) return;
        // Only a regular file is read: a pipe would block, a device may never end.
        if ((info.getAttr() & FsFileInfo::ATTR_REGULAR) == 0) return;
        FileChecksumInfo sums;
        if (options.md5) sums.flags |= FILE_CHECKSUM_MD5;
        if (options.crc32) sums.flags |= FILE_CHECKSUM_CRC32;
        if (options.q32) sums.flags |= FILE_CHECKSUM_Q32;
        std::string full;
        appendLocal(full, info.getPath());
        if (!full.empty() && full.back() != '/') full.push_back('/');
        appendLocal(full, info.getName());
        if (computeRegularFileChecksumInfo(sums, full.c_str()) != 0) return;
        if (options.md5) {
            wchar_t text[MD5_TEXT_SIZE];
            md52wchar_t(sums.md5, text);
            info.setMD5(text);
        }
        if (options.crc32) info.setCRC32(sums.crc32);
        if (options.q32) info.setQ32(sums.q32);
    }

    void appendJson(FsFileInfo& info) {
        // What the record lacks comes from the file itself, once, before any
        // field is read.
        info.updateInfo();
        unsigned int attr = info.getAttr();
        char numbers[512];
        buffer += "{\"path\":";
        appendJsonString(buffer, info.getPath());
        buffer += ",\"name\":";
        appendJsonString(buffer, info.getName());
        buffer += ",\"fullPath\":";
        wchar_t* full = getPathName(info.getPath(), info.getName());
        appendJsonString(buffer, full);
        delete[] full;
        buffer += ",\"md5\":";
        appendJsonString(buffer, info.getMD5());
        buffer += ",\"sha256\":";
        appendJsonString(buffer, info.getSHA256());
        std::snprintf(numbers, sizeof numbers,
                      ",\"attr\":%u,\"size\":%llu,\"device\":%u,\"groupId\":%u,\"userId\":%u,"
                      "\"iNode\":%u,\"lastAccessTime\":%ld,\"createTime\":%ld,\"lastModifyTime\":%ld,"
                      "\"linkCount\":%u,\"crc32\":%u,\"q32\":%u,\"validMask\":%u,\"statFailed\":%s}\n",
                      attr, info.getSize(), info.getDevice(), info.getGroupId(), info.getUserId(),
                      info.getINode(), info.getLastAccessTime(), info.getCreateTime(),
                      info.getLastModifyTime(), info.getLinkCount(), info.getCRC32(), info.getQ32(),
                      info.getValidMask(), info.getStatFailed() ? "true" : "false");
        buffer += numbers;
    }

    void appendCsv(FsFileInfo& info, const std::string& full) {
        info.updateInfo();
        unsigned int attr = info.getAttr();
        appendCsvField(buffer, narrow(info.getPath()));
        buffer.push_back(',');
        appendCsvField(buffer, narrow(info.getName()));
        buffer.push_back(',');
        appendCsvField(buffer, full);
        buffer.push_back(',');
        appendCsvField(buffer, narrow(info.getMD5()));
        buffer.push_back(',');
        appendCsvField(buffer, narrow(info.getSHA256()));
        char numbers[256];
        std::snprintf(numbers, sizeof numbers, ",%u,%llu,%u,%u,%u,%u,%ld,%ld,%ld,%u,%u,%u\n", attr,
                      info.getSize(), info.getDevice(), info.getGroupId(), info.getUserId(),
                      info.getINode(), info.getLastAccessTime(), info.getCreateTime(),
                      info.getLastModifyTime(), info.getLinkCount(), info.getCRC32(), info.getQ32());
        buffer += numbers;
    }

    void flushIfFull() {
        if (buffer.size() >= (1 << 16) - 4096) flush();
    }
    void flush() {
        if (buffer.empty()) return;
        if (!broken) {
            progress.beforeOutput();
            if (std::fwrite(buffer.data(), 1, buffer.size(), stdout) != buffer.size()) {
                broken = (errno == EPIPE) ? 1 : 2;
            }
        }
        buffer.clear();
    }

    const Options& options;
    Progress& progress;
    bool fillSums;
    std::string buffer;
    int broken = 0;  // 0 fine, 1 pipe closed, 2 write error
};

// The writer the engine and the walk see: counts hits and prints them.
class PrintingWriter : public FsResultSetWriter {
public:
    PrintingWriter(Printer& p, bool quick) : printer(p), quickText(quick) {}
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int attr,
                  const wchar_t* md5, unsigned int crc32, unsigned int q32) override {
        hits.fetch_add(1, std::memory_order_relaxed);
        if (quickText) {
            printer.print(path, name);
            return 0;
        }
        FsFileInfo info;
        info.setFilePath(path);
        info.setFileName(name);
        info.setFileSize(size);
        info.setFileAttr(attr);
        info.setCRC32(crc32);
        info.setQ32(q32);
        info.setMD5(md5);
        printer.print(info);
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        hits.fetch_add(1, std::memory_order_relaxed);
        if (quickText) {
            printer.print(info.getPath(), info.getName());
            return 0;
        }
        FsFileInfo copy(info);
        printer.print(copy);
        return 0;
    }
    int close() override { return 0; }

    std::atomic<long long> hits{0};

private:
    Printer& printer;
    bool quickText;
};

// Forwards to the writer of a result file and counts.
class CountingWriter : public FsResultSetWriter {
public:
    explicit CountingWriter(FsResultSetWriter* t) : target(t) {}
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int attr,
                  const wchar_t* md5, unsigned int crc32, unsigned int q32) override {
        hits.fetch_add(1, std::memory_order_relaxed);
        return target->addRecord(path, name, size, attr, md5, crc32, q32);
    }
    int addRecord(const FsFileInfo& info) override {
        hits.fetch_add(1, std::memory_order_relaxed);
        return target->addRecord(info);
    }
    int close() override { return target->close(); }

    std::atomic<long long> hits{0};

private:
    FsResultSetWriter* target;
};

// ----------------------------------------------------------- temp names

// The result file of --sort lives in the cache directory.
std::string gTempDirectory;
char gTempName[4200];
unsigned int gTempCounter = 0;

char* tempNameInCache(char*) {
    std::snprintf(gTempName, sizeof gTempName, "%s/sort-%ld-%u.tmp", gTempDirectory.c_str(),
                  static_cast<long>(getpid()), gTempCounter++);
    return gTempName;
}

void onTerminate(int signal) {
    // Removes the result file of a sort in progress; the engine's own update
    // flag tells the next run that this one did not finish.
    FsResourceManager::getInstance()->invokeCleanupHandlers(signal);
    ::signal(signal, SIG_DFL);
    raise(signal);
}

// ----------------------------------------------------------- cache side

bool makeDirectories(const std::string& path, std::string& error) {
    std::string partial;
    size_t pos = 0;
    while (pos != std::string::npos) {
        size_t next = path.find('/', pos + 1);
        partial = path.substr(0, next);
        pos = next;
        if (partial.empty() || partial == "/") continue;
        if (mkdir(partial.c_str(), 0700) != 0 && errno != EEXIST) {
            error = partial + ": " + std::strerror(errno);
            return false;
        }
    }
    struct stat st;
    if (stat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
        error = path + ": not a directory";
        return false;
    }
    return true;
}

std::string defaultCacheDirectory() {
    const char* xdg = std::getenv("XDG_CACHE_HOME");
    if (xdg != nullptr && xdg[0] == '/') return std::string(xdg) + "/fsquery";
    const char* home = std::getenv("HOME");
    if (home != nullptr && home[0] != '\0') return std::string(home) + "/.cache/fsquery";
    return std::string();
}

// Subdirectory of one kind of cache (see the head of this file).
std::string cacheKind(const Options& o) {
    std::string kind;
    if (o.cacheFiles.empty()) {
        kind = "all";
    } else {
        std::vector<std::string> masks = o.cacheFiles;
        if (o.ignoreCase) {
            for (std::string& m : masks) {
                for (char& c : m) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
            }
        }
        std::sort(masks.begin(), masks.end());
        masks.erase(std::unique(masks.begin(), masks.end()), masks.end());
        uint32_t hash = 2166136261u;  // FNV-1a over the masks, each ended by a 0 byte
        for (const std::string& m : masks) {
            for (char c : m) hash = (hash ^ static_cast<unsigned char>(c)) * 16777619u;
            hash = (hash ^ 0u) * 16777619u;
        }
        kind = "sel-" + hex8(hash);
    }
    if (o.md5 || o.crc32 || o.q32) kind += "+sums";
    return kind;
}

const char* resultName(int result) {
    switch (result) {
    case CACHE_UNUSABLE: return "cache unusable";
    case SCAN_TIMED_OUT: return "scan timed out";
    case BUILD_TIMED_OUT: return "build timed out";
    case CACHE_ALREADY_OPENED: return "cache already opened";
    case CACHE_LOCK_TIMED_OUT: return "cache locked by another process";
    case CACHE_ERROR: return "cache error";
    default: return "unknown result";
    }
}

int exitCodeOf(int result) {
    switch (result) {
    case SUCCESS: return EXIT_OK;
    case CACHE_UNUSABLE: return EXIT_CACHE_UNUSABLE;
    case SCAN_TIMED_OUT: return EXIT_SCAN_TIMED_OUT;
    case BUILD_TIMED_OUT: return EXIT_BUILD_TIMED_OUT;
    case CACHE_ALREADY_OPENED: return EXIT_ALREADY_OPENED;
    case CACHE_LOCK_TIMED_OUT: return EXIT_LOCK_TIMED_OUT;
    default: return EXIT_CACHE_ERROR;
    }
}

long long countCacheEntries(const void* source) {
    const FS_CacheBase* cache = static_cast<const FS_CacheBase*>(source);
    // Read while the query thread counts; a relaxed read of a plain int.
    int files = __atomic_load_n(&cache->filesScanned, __ATOMIC_RELAXED);
    int directories = __atomic_load_n(&cache->directoriesScanned, __ATOMIC_RELAXED);
    return static_cast<long long>(files) + directories;
}

// Files the direct walk offered to the criteria stage.
std::atomic<long long> gWalkOffered{0};

void observeWalk(const FsFileInfo&, const FileChecksumInfo&, const wchar_t*) {
    gWalkOffered.fetch_add(1, std::memory_order_relaxed);
}

long long countWalkEntries(const void*) { return gWalkOffered.load(std::memory_order_relaxed); }

struct RunStats {
    std::string mode;
    int rootsServed = 0;
    int rootsRebuilt = 0;
    int rootsWalked = 0;
    long long filesScanned = 0;
    long long directoriesScanned = -1;  // unknown for the direct walk
};

// The direct walk: the query's paths are resolved against the drive list as
// the engine resolves them, and every root is walked by fs_build, hits going
// straight to the writer.
int runDirectWalk(FsQuery& query, FsResultSetWriter& writer, const Options& o, FileHashBlackBox* hashes,
                  RunStats& stats) {
    bool caseFlag = query.getCaseSensitive();
    CpuThreshold::Initialize(query.getCpuThreshold());
    DriveHelper driveHelper;
    driveHelper.setAssumeAutoFSDriveType(query.getAssumeAutoFSDriveType());
    std::vector<DriveInfo> drives, pruned;
    driveHelper.buildDriveList(drives, mdAllDrives);
    std::vector<PathInfo> excludedPaths = query.getExcludedPaths();
    driveHelper.fileSystemDriveListPruning(drives, pruned, query.getIncludedFileSystems(),
                                           query.getExcludedFileSystems(), caseFlag, excludedPaths);
    PathHelper pathHelper(1);
    std::vector<PathInfo> drivePaths, prunedPaths, droppedPaths;
    pathHelper.buildPathList(drives, drivePaths);
    pathHelper.buildPathList(pruned, prunedPaths);
    pathHelper.differencePathList(drivePaths, prunedPaths, droppedPaths);
    std::vector<PathDrive> parents, resolved, excludedOut, unresolved;
    std::vector<PathDrive> exParents, exResolved, exExcluded, exUnresolved;
    pathHelper.pathResolver(query.getIncludedPaths(), pruned, prunedPaths, droppedPaths, parents, resolved,
                            excludedOut, unresolved, mdLocalDriveGroup);
    pathHelper.pathResolver(excludedPaths, pruned, prunedPaths, droppedPaths, exParents, exResolved,
                            exExcluded, exUnresolved, mdAllDrives);
    std::vector<PathDrive> roots;
    pathHelper.pathDriveAccumulator(parents, roots, true);
    std::vector<PathInfo> includes;
    pathHelper.extractPathList(resolved, 0x3f, includes);

    unsigned int flags = FileProcessor::PROCESS_DEFAULT;
    if (o.md5 || !o.knownMd5.empty()) flags |= FileProcessor::PROCESS_MD5;
    if (o.crc32) flags |= FileProcessor::PROCESS_CRC32;
    if (o.q32) flags |= FileProcessor::PROCESS_Q32;
    FileProcessor::setCriteriaObserver(observeWalk);
    unsigned int start = getTickCount();
    int result = SUCCESS;
    for (size_t i = 0; i < parents.size(); ++i) {
        CpuThreshold::doIteration();
        std::vector<PathInfo> excludes;
        pathHelper.buildExcludeList(drives, parents[i], excludes);
        pathHelper.fillExclude(parents[i], exResolved, excludes);
        unsigned int used = getTickCount() - start;
        long left = static_cast<long>(o.timeoutMs) - static_cast<long>(used);
        if (left < 1) left = 0;
        FileProcessor processor(query.getQuery(), caseFlag, flags, hashes);
        ++stats.rootsWalked;
        if (fs_build(writer, processor, parents[i], includes, excludes, caseFlag, static_cast<int>(left)) ==
            FS_SCAN_TIMED_OUT) {
            result = SCAN_TIMED_OUT;
            break;
        }
    }
    FileProcessor::setCriteriaObserver(nullptr);
    stats.filesScanned = gWalkOffered.load();
    return result;
}

int countMessages(const std::vector<QvLogWrapper::Message>& messages, const char* text) {
    int n = 0;
    for (const QvLogWrapper::Message& m : messages) {
        if (m.text.compare(0, std::strlen(text), text) == 0) ++n;
    }
    return n;
}

// One query through a cache object of the given kind, bracketed as a host
// must: lock, create, query, unlock, close.  The object lives on the stack:
// the base class has no virtual destructor.
template <typename CacheType>
int queryThroughCache(FsQuery& query, FsResultSetWriter& writer, const Options& o, FsGlue& glue,
                      const std::string& directory, Progress& progress, std::atomic<long long>* hits,
                      RunStats& stats) {
    QvLogWrapper* log = getQvLogFs();
    std::wstring wideDirectory = toWide(directory);
    std::wstring provider = toWide(o.provider);
    CacheType cache(L"directories", L"files", wideDirectory.c_str(), true, true, &glue, provider.c_str());
    // The lock comes first: opening a cache that another process holds would
    // take its update flag for the mark of a crash.
    int result = cache.lock(o.lockWaitMs);
    if (result == CACHE_LOCK_TIMED_OUT) {
        std::fprintf(stderr,
                     "fsquery: the cache %s is locked by another process (waited %d ms; see --lock-wait)\n",
                     directory.c_str(), o.lockWaitMs);
        return result;
    }
    if (result != SUCCESS) {
        std::fprintf(stderr, "fsquery: cannot lock the cache %s: %s (%d)\n", directory.c_str(),
                     resultName(result), result);
        return result;
    }
    result = cache.create(o.timeoutMs, FS_CACHE_OPEN_ALWAYS);
    if (result != SUCCESS) {
        std::fprintf(stderr, "fsquery: cannot open the cache %s: %s (%d)\n", directory.c_str(),
                     resultName(result), result);
    } else {
        if (o.stats) log->startCapture(QvLogWrapper::LEVEL_MIN);
        progress.start(countCacheEntries, &cache, hits);
        result = cache.executeQueryEx(writer, query, o.timeoutMs, o.maxAge);
        progress.finish();
        if (o.stats) {
            std::vector<QvLogWrapper::Message> messages = log->stopCapture();
            for (const QvLogWrapper::Message& m : messages) {
                if (m.text.find(" - retrieving data from cache for ") != std::string::npos) ++stats.rootsServed;
            }
            stats.rootsRebuilt = countMessages(messages, "IMPORTANT: File system access on ");
        }
        stats.filesScanned = cache.filesScanned;
        stats.directoriesScanned = cache.directoriesScanned;
        if (result != SUCCESS) {
            std::fprintf(stderr, "fsquery: %s (%d)%s\n", resultName(result), result,
                         (result == CACHE_UNUSABLE || result == BUILD_TIMED_OUT)
                             ? "; the cache is discarded and rebuilt by the next run"
                             : "");
        }
    }
    cache.unlock();
    cache.close();
    return result;
}

bool pathLooksPlain(const std::string& path) {
    return path.find(':') == std::string::npos && path.find('*') == std::string::npos &&
           path.find('?') == std::string::npos && (path.empty() || path[0] != '$');
}

int run(const Options& o) {
    auto startTime = std::chrono::steady_clock::now();
    // The configuration comes first, so that its trace settings are the ones
    // the trace handle finds.
    if (!o.configFile.empty() && !KelCfg::loadFile(o.configFile.c_str())) {
        std::fprintf(stderr, "fsquery: cannot read configuration file '%s': %s\n", o.configFile.c_str(),
                     static_cast<const char*>(KelCfg::getError()));
        return EXIT_USAGE;
    }
    QvLogWrapper* log = getQvLogFs();
    if (!o.traceFile.empty() || o.traceLevel >= 0) {
        int level = o.traceLevel >= 0 ? o.traceLevel : 1;
        if (!log->configure(level, o.traceFile.empty() ? nullptr : o.traceFile.c_str())) {
            std::fprintf(stderr, "fsquery: cannot open trace file '%s'\n", o.traceFile.c_str());
            return EXIT_FAILED;
        }
    }
    if (!o.mountTable.empty()) MountTableManager::setMountTablePath(o.mountTable.c_str());
    if (!o.automounterMaster.empty()) DriveHelper::setAutomounterMasterPath(o.automounterMaster.c_str());

    for (const std::string& p : o.paths) {
        struct stat st;
        if (pathLooksPlain(p) && stat(p.c_str(), &st) != 0) {
            std::fprintf(stderr, "fsquery: '%s': %s\n", p.c_str(), std::strerror(errno));
            return EXIT_USAGE;
        }
    }

    // The query.
    FsQuery query;
    if (o.ignoreCase) query.setCaseSensitive(1);
    for (const std::string& p : o.paths) query.addIncludePath(toWide(p).c_str(), !o.nonRecursive);
    for (const std::string& p : o.excludes) query.addExcludePath(toWide(p).c_str(), true);
    for (const std::string& f : o.includeFs) query.addIncludeFileSystem(toWide(f).c_str());
    for (const std::string& f : o.excludeFs) query.addExcludeFileSystem(toWide(f).c_str());
    for (const std::string& m : o.cacheFiles) query.addFileOrMaskForCaching(toWide(m).c_str());
    if (!o.cpu.empty()) query.setCpuThreshold(o.cpu.c_str());
    std::wstring expression = toWide(buildExpression(o));
    ExpressionCheck check = checkExpression(expression, o.noCache);
    if (!check.ok) {
        std::string text;
        appendLocal(text, expression.c_str());
        std::fprintf(stderr, "fsquery: invalid expression '%s'%s%s%s\n", text.c_str(),
                     check.reason.empty() ? "" : " (", check.reason.c_str(), check.reason.empty() ? "" : ")");
        return EXIT_USAGE;
    }
    query.setQuery(expression.c_str());

    FileHashBlackBox hashes;
    for (const std::string& hex : o.knownMd5) hashes.insert_md5(char2md5(hex.c_str()));

    // The cache directory; also home of the sort file in --no-cache mode.
    std::string base = o.cacheDir.empty() ? defaultCacheDirectory() : o.cacheDir;
    if (base.empty()) {
        std::fprintf(stderr, "fsquery: no cache directory: set XDG_CACHE_HOME or HOME, or give --cache\n");
        return EXIT_FAILED;
    }
    std::string directory = o.noCache ? base : base + "/" + cacheKind(o);
    std::string error;
    if ((!o.noCache || o.sortKey != 0) && !makeDirectories(directory, error)) {
        std::fprintf(stderr, "fsquery: cannot create the cache directory %s\n", error.c_str());
        return EXIT_FAILED;
    }
    if (!o.noCache || o.sortKey != 0) {
        char* real = realpath(directory.c_str(), nullptr);
        if (real != nullptr) {
            directory = real;
            std::free(real);
        }
    }

    Progress progress;
    Printer printer(o, progress, o.noCache && (o.md5 || o.crc32 || o.q32));
    bool quickText = o.format == FORMAT_NULL ||
                     (o.format == FORMAT_TEXT && !o.md5 && !o.crc32 && !o.q32);
    PrintingWriter printing(printer, quickText);
    FsResultSet_OnFile* resultFile = nullptr;
    CountingWriter* counting = nullptr;
    FsResultSetWriter* writer = &printing;
    std::atomic<long long>* hits = &printing.hits;
    if (o.sortKey != 0) {
        gTempDirectory = directory;
        FsResultSet_OnFile::setTempNameSources(tempNameInCache, (directory + "/").c_str(),
                                               (directory + "/").c_str());
        resultFile = new FsResultSet_OnFile();
        counting = new CountingWriter(resultFile->getWriter());
        writer = counting;
        hits = &counting->hits;
    }
    printer.header();

    RunStats stats;
    int result = SUCCESS;
    if (o.noCache) {
        stats.mode = "direct walk, no cache";
        progress.start(countWalkEntries, nullptr, hits);
        result = runDirectWalk(query, *writer, o, hashes.empty() ? nullptr : &hashes, stats);
        progress.finish();
    } else {
        if (!LinuxSharedMutex::setStorePath(directory.c_str()) ||
            std::strlen(LinuxSharedMutex::storePath) == 0) {
            std::fprintf(stderr, "fsquery: cache directory path too long: %s\n", directory.c_str());
            delete counting;
            delete resultFile;
            return EXIT_FAILED;
        }
        // The engine's list of scanned folders goes to "common_trace_path",
        // which without a setting means the root directory: unless the
        // configuration names a place, the list stays in the cache.
        if (KelCfg::getKey("common_trace_path").length() == 0) {
            KelCfg::setKey("common_trace_path", directory.c_str());
        }
        FsGlue glue;
        glue.knownHashes = hashes.empty() ? nullptr : &hashes;
        glue.checksumFlags = (o.md5 ? 0x20u : 0u) | (o.crc32 ? 0x40u : 0u) | (o.q32 ? 0x80u : 0u);
        glue.reserved = 0;
        glue.cacheRemoteDrives = false;
        stats.mode = std::string(o.cacheFiles.empty() ? "cache (FS_Cache) in " : "cache (FS_Cache2) in ") +
                     directory;
        if (o.cacheFiles.empty()) {
            result = queryThroughCache<FS_Cache>(query, *writer, o, glue, directory, progress, hits, stats);
        } else {
            result = queryThroughCache<FS_Cache2>(query, *writer, o, glue, directory, progress, hits, stats);
        }
    }
    if (result == SCAN_TIMED_OUT && o.noCache) {
        std::fprintf(stderr, "fsquery: %s (%d)\n", resultName(result), result);
    }

    // The writers go with the result file below; their count stays here.
    long long hitTotal = hits->load();
    hits = nullptr;

    // A sorted result is read back from its file.
    if (resultFile != nullptr) {
        FsResultSetReader* reader = resultFile->getReader();
        if (result == SUCCESS) {
            reader->sort(o.sortKey, o.reverse ? 2 : 1, query.getCaseSensitive());
            reader->moveFirst();
            FsFileInfo info;
            while (reader->getNext(info) == 1) {
                if (quickText) printer.print(info.getPath(), info.getName());
                else printer.print(info);
            }
        }
        delete reader;
        delete counting;
        delete resultFile;
        FsResultSet_OnFile::resetTempNameSources();
    }
    bool outputOk = printer.finish();

    if (o.stats) {
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - startTime).count();
        std::fprintf(stderr, "fsquery: mode: %s\n", stats.mode.c_str());
        if (o.noCache) {
            std::fprintf(stderr, "fsquery: roots: %d walked directly\n", stats.rootsWalked);
            std::fprintf(stderr, "fsquery: scanned: %lld files\n", stats.filesScanned);
        } else {
            std::fprintf(stderr, "fsquery: roots: %d served from the cache, %d rebuilt\n", stats.rootsServed,
                         stats.rootsRebuilt);
            std::fprintf(stderr, "fsquery: scanned: %lld files, %lld directories\n", stats.filesScanned,
                         stats.directoriesScanned);
        }
        std::fprintf(stderr, "fsquery: lookup: %s\n",
                     check.indexColumn.empty() ? "every row" : ("index on " + check.indexColumn).c_str());
        std::fprintf(stderr, "fsquery: hits: %lld\n", hitTotal);
        std::fprintf(stderr, "fsquery: time: %.3f s\n", seconds);
    }
    if (!outputOk) {
        std::fprintf(stderr, "fsquery: cannot write the output: %s\n", std::strerror(errno));
        if (result == SUCCESS) return EXIT_FAILED;
    }
    return exitCodeOf(result);
}

}  // namespace

int main(int argc, char** argv) {
    // File names reach the library through the locale's conversions; without
    // a locale of its own the tool takes UTF-8, the form of nearly every name.
    const char* ctype = std::setlocale(LC_CTYPE, "");
    if (ctype == nullptr || std::strcmp(ctype, "C") == 0 || std::strcmp(ctype, "POSIX") == 0) {
        if (std::setlocale(LC_CTYPE, "C.UTF-8") == nullptr) std::setlocale(LC_CTYPE, "C");
    }
    signal(SIGPIPE, SIG_IGN);
    signal(SIGFPE, onArithmeticFault);
    signal(SIGINT, onTerminate);
    signal(SIGTERM, onTerminate);

    Options options;
    try {
        bool done = false;
        options = parseCommandLine(argc, argv, done);
        if (done) return std::fflush(stdout) == 0 ? EXIT_OK : EXIT_FAILED;
    } catch (const UsageError& e) {
        std::fprintf(stderr, "fsquery: %s (see fsquery --help)\n", e.message.c_str());
        return EXIT_USAGE;
    }
    return run(options);
}
