// fsquery: the command-line host of the library.
//
//   fsquery [OPTIONS] [PATH...]
//
// Runs one query through FS_Cache (or FS_Cache2 when caching masks are given)
// on a cache directory that persists between runs, and prints the hits.  With
// --no-cache the same paths are resolved the same way and walked directly with
// fs_build, and the hits pass the rules of the cache's extraction (HitFilter),
// so that both modes give one answer.  Run `fsquery --help` for the options
// and the exit codes.
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
// Each holds the tool's lock file "fsquery.lock" (see ToolLock), and while a
// query from the cache runs, its output waits in a file without a name there
// once it outgrows memory (see Printer::hold).
#include <fcntl.h>
#include <langinfo.h>
#include <signal.h>
#include <sys/file.h>
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
#include <ctime>
#include <cwchar>
#include <cwctype>
#include <map>
#include <mutex>
#include <set>
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
#include "fscanner/fscommon/lexer.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

const char kVersion[] = "0.1.0";

// Exit codes.  Every negative result of the engine has its own.
enum ExitCode {
    EXIT_OK = 0,                 // done, with hits or without
    EXIT_FAILED = 1,             // the tool itself failed (cache directory, output, trace file)
    EXIT_ENTRIES_SKIPPED = 1,    // done, but entries that could not be read are missing (as find)
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
    bool stat = false;      // --stat: status fields, read afresh
    bool print0 = false;    // -0: NUL after each path
    bool refresh = false;   // --refresh: rebuild the trees of this query now
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
    // The whole of most texts is ASCII: narrowed in one pass, four
    // characters a step, that also finds whether it was; where it was not,
    // the narrowed text goes again and the locale writes it.
    size_t length = std::wcslen(text);
    size_t at = out.size();
    out.resize(at + length);
    char* to = &out[at];
    uint32_t marks = 0;
    size_t i = 0;
    for (; i + 4 <= length; i += 4) {
        uint32_t c0 = static_cast<uint32_t>(text[i]), c1 = static_cast<uint32_t>(text[i + 1]);
        uint32_t c2 = static_cast<uint32_t>(text[i + 2]), c3 = static_cast<uint32_t>(text[i + 3]);
        marks |= (c0 | c1) | (c2 | c3);
        to[i] = static_cast<char>(c0);
        to[i + 1] = static_cast<char>(c1);
        to[i + 2] = static_cast<char>(c2);
        to[i + 3] = static_cast<char>(c3);
    }
    for (; i < length; ++i) {
        marks |= static_cast<uint32_t>(text[i]);
        to[i] = static_cast<char>(text[i]);
    }
    if (marks < 0x80) return;
    out.resize(at);
    char buffer[MB_LEN_MAX];
    std::mbstate_t state = std::mbstate_t();
    for (; *text != L'\0'; ++text) {
        if (static_cast<unsigned int>(*text) < 0x80) {
            // A run of ASCII, the whole of most paths, goes in at once.
            const wchar_t* end = text + 1;
            while (*end != L'\0' && static_cast<unsigned int>(*end) < 0x80) ++end;
            size_t at = out.size();
            out.resize(at + static_cast<size_t>(end - text));
            for (char* to = &out[at]; text != end; ++text) *to++ = static_cast<char>(*text);
            --text;
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
        "Prints the entries below PATH (default: the working directory) that answer the\n"
        "query, from a cache that persists between runs.  Listed are files, symbolic\n"
        "links (never followed), devices, FIFOs and sockets; directories are not.\n"
        "\n"
        "PATH: a path that exists is taken literally, whatever its name holds (a\n"
        "symbolic link given as PATH is followed, and the entries are listed under\n"
        "its target).  Any other PATH takes the library's path syntax, for naming\n"
        "drives (mount points) and media: [MEDIA::][DRIVE:]PATH, e.g. $local::/usr,\n"
        "$remote::/home, /usr:/usr/lib, *:/home.  A PATH that names no existing\n"
        "directory is an error; one that names only a file is left out with a warning.\n"
        "\n"
        "Selection:\n"
        "  -e, --expression EXPR query expression, e.g. '[SIZE]>1000 && [FILENAME]==\"*.c\"'\n"
        "                        (columns FILENAME ATTR SIZE PATHID MD5 CRC32 Q32;\n"
        "                        repeatable: all of them must hold)\n"
        "  --name MASK           shorthand for [FILENAME]==\"MASK\" (repeatable: any of\n"
        "                        them); masks know * (any run) and ? (one character) only\n"
        "  --ignore-case         names and texts compare without regard to case\n"
        "  --exclude PATH        leave the directory PATH and everything below it out\n"
        "                        (repeatable; * and ? match; a file is never left out\n"
        "                        on its own)\n"
        "  --non-recursive       report only the entries directly in each PATH\n"
        "  --include-fs TYPE     only drives of this file system type (repeatable)\n"
        "  --exclude-fs TYPE     no drives of this file system type (repeatable)\n"
        "  --known-md5 HEX       only regular files with one of these MD5 sums (repeatable)\n"
        "\n"
        "Cache:\n"
        "  --cache DIR           cache directory (default $XDG_CACHE_HOME/fsquery,\n"
        "                        else ~/.cache/fsquery)\n"
        "  --no-cache            walk the file system directly, keep nothing; needs no\n"
        "                        cache directory\n"
        "  --cache-files MASK    keep only files matching MASK in the cache (FS_Cache2;\n"
        "                        repeatable); a --name that no kept file can match is\n"
        "                        warned about\n"
        "  --max-age SECONDS     rebuild a cached tree older than this (default 86400);\n"
        "                        0 rebuilds every time, an age reaching back before\n"
        "                        1970 never rebuilds\n"
        "  --refresh             rebuild the cached trees of this query now, whatever\n"
        "                        their age\n"
        "  --timeout MS          time budget of the query (default 2000000000)\n"
        "  --lock-wait MS        how long to wait while another run uses the cache\n"
        "                        (default 5000); runs on one cache take turns through\n"
        "                        the file fsquery.lock in it, which is never removed\n"
        "  --cpu RUN:SLEEP       throttle: run RUN ms, then sleep SLEEP ms\n"
        "  --md5, --crc32, --q32 compute and report these checksums (regular files only)\n"
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
        "  -0, --print0          text: end each path with a NUL instead of a newline\n"
        "  --stat                json, csv: add device, owner, inode, times and links,\n"
        "                        read from the file now together with size and attr\n"
        "  --stats               tell on standard error how the query was answered\n"
        "  -h, --help, --version\n"
        "\n"
        "Text output is the path; with --md5, --crc32 or --q32 the sums come first, as\n"
        "md5sum writes them, and only regular files are listed.  json and csv give\n"
        "path, name, fullPath, md5, sha256, attr, size, crc32 and q32 as the answer\n"
        "holds them; a checksum not asked for, or of an entry that is no regular file,\n"
        "is null in json and empty in csv.  An answer from the cache is printed when the\n"
        "query has succeeded; a failed query prints nothing.\n"
        "\n"
        "With and without the cache the answer is the same, up to the age of the cache,\n"
        "with two differences.  Without the cache PATHID is 0, MD5 \"0\", CRC32 and Q32\n"
        "are 0 for every file, so --no-cache refuses an expression that reads them\n"
        "(--known-md5 works in both modes).  Trees on remote drives are walked directly\n"
        "in both modes; there an --exclude also leaves out single entries.\n"
        "\n"
        "Testing:\n"
        "  --mount-table FILE    read mounts from FILE instead of /etc/mtab\n"
        "  --automounter-master FILE  read automounter maps from FILE\n"
        "\n"
        "Exit status: 0 done (with or without hits); 1 the tool failed, or entries\n"
        "could not be read; 2 usage error (also a bad expression, or a PATH that names\n"
        "no directory); 3 cache unusable; 4 scan timed out; 5 build timed out; 6 cache\n"
        "already opened; 7 cache locked by another process; 8 cache error.\n",
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
        } else if (name == "--stat") {
            noValue();
            o.stat = true;
        } else if (name == "-0" || name == "--print0") {
            noValue();
            o.print0 = true;
        } else if (name == "--refresh") {
            noValue();
            o.refresh = true;
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
    if (o.print0 && o.format != FORMAT_TEXT) throw UsageError{"option '-0' needs '--format text'"};
    if (o.stat && o.format != FORMAT_JSON && o.format != FORMAT_CSV) {
        throw UsageError{"option '--stat' needs '--format json' or '--format csv'"};
    }
    // The engine keeps a tree while its build time is not below now minus
    // the age, in unsigned 32-bit seconds.  So an age of 0 still serves a
    // tree built in this very second, and an age above the seconds since
    // 1970 wraps round and refuses every tree.  The tool gives the words
    // their plain meaning: 0 (as --refresh) rebuilds now, and an age that
    // reaches back before 1970 keeps a tree however old it is.
    unsigned int now = static_cast<unsigned int>(time(nullptr));
    if (o.refresh || o.maxAge == 0) {
        // now - UINT_MAX wraps to now + 1: every tree is older than that.
        o.maxAge = UINT_MAX;
    } else if (o.maxAge >= now) {
        o.maxAge = now;
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
// silent empty answer.  The columns are the cache's; the direct walk has the
// same ones (and SHORTFILENAME, which it never fills: it is not offered).
ExpressionCheck checkExpression(const std::wstring& expression) {
    ExpressionCheck result;
    Fields columns;
    columns.add(L"FILENAME", FIELD_TEXT);
    columns.add(L"ATTR", FIELD_INT32);
    columns.add(L"SIZE", FIELD_INT64);
    columns.add(L"PATHID", FIELD_INT32);
    columns.add(L"MD5", FIELD_TEXT);
    columns.add(L"CRC32", FIELD_INT32);
    columns.add(L"Q32", FIELD_INT32);
    // Values of 1, so that a division by a column does not fault here.
    for (unsigned int i = 0; i < columns.count(); ++i) {
        Field* f = columns.at(i);
        if (f->getType() == FIELD_INT32) static_cast<Int32Field*>(f)->value(1u);
        else if (f->getType() == FIELD_INT64) static_cast<Int64Field*>(f)->value(1ull);
        else if (f->getType() == FIELD_TEXT) static_cast<TextField*>(f)->value(L"x");
    }
    PathStub pathStub;
    TypeStub typeStub;
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
    if (!result.ok && evaluator.getAnalyzer() != nullptr) {
        result.reason = evaluator.getAnalyzer()->getErrorText();
    }
    return result;
}

// The names an expression reads: columns written [NAME] and bare words.
std::vector<std::wstring> namesRead(const std::wstring& expression) {
    std::vector<std::wstring> names;
    Lexer lexer;
    lexer.setExpression(expression.c_str());
    while (true) {
        fsToken token = lexer.nextToken();
        if (lexer.getLastError() != Lexer::LEX_OK || token.getType() == TOKEN_END) break;
        if (token.getType() == TOKEN_FIELD || token.getType() == TOKEN_VARIABLE) {
            names.push_back(token.getStringValue());
        }
    }
    return names;
}

// The first name the expression reads that is no column, or "".
std::string unknownColumn(const std::wstring& expression) {
    static const wchar_t* const columns[] = {L"FILENAME", L"ATTR", L"SIZE", L"PATHID", L"MD5", L"CRC32", L"Q32"};
    for (const std::wstring& name : namesRead(expression)) {
        bool known = false;
        for (const wchar_t* c : columns) known = known || name == c;
        if (!known) {
            std::string text;
            appendLocal(text, name.c_str());
            return text;
        }
    }
    return std::string();
}

// The direct walk has the cache's columns, but not their values for four of
// them: it reads PATHID as 0, MD5 as "0", CRC32 and Q32 as 0 for every file
// (checksums reach it only through the known-checksum set).  An expression
// that reads one of them could only match from the cache: the reason why
// --no-cache refuses it, or "".
std::string cacheOnlyColumn(const std::wstring& expression) {
    for (const std::wstring& name : namesRead(expression)) {
        if (name == L"PATHID") {
            return "--no-cache cannot answer an expression that reads PATHID: without the cache every file "
                   "has PATHID 0 (it numbers directories in the cache), so the expression could only match "
                   "from the cache";
        }
        if (name == L"MD5") {
            return "--no-cache cannot answer an expression that reads MD5: without the cache every file has "
                   "MD5 \"0\", so the expression could only match from the cache (--known-md5 selects by MD5 "
                   "in both modes)";
        }
        if (name == L"CRC32" || name == L"Q32") {
            std::string column = name == L"CRC32" ? "CRC32" : "Q32";
            return "--no-cache cannot answer an expression that reads " + column + ": without the cache every "
                   "file has " + column + " 0, so the expression could only match from the cache";
        }
    }
    return std::string();
}

// True when some name could match both masks ("*" any run, "?" one
// character; anything else stands for itself).
bool masksMeet(const std::wstring& a, const std::wstring& b) {
    size_t n = a.size(), m = b.size();
    std::vector<char> seen((n + 1) * (m + 1), 0);
    std::vector<std::pair<size_t, size_t>> todo;
    todo.push_back(std::make_pair(size_t(0), size_t(0)));
    while (!todo.empty()) {
        size_t i = todo.back().first, j = todo.back().second;
        todo.pop_back();
        if (seen[i * (m + 1) + j]) continue;
        seen[i * (m + 1) + j] = 1;
        if (i == n && j == m) return true;
        // A star may stand for nothing.
        if (i < n && a[i] == L'*') todo.push_back(std::make_pair(i + 1, j));
        if (j < m && b[j] == L'*') todo.push_back(std::make_pair(i, j + 1));
        // One character that both accept here.
        if (i < n && j < m) {
            bool anyA = a[i] == L'*' || a[i] == L'?';
            bool anyB = b[j] == L'*' || b[j] == L'?';
            if ((anyA || anyB || a[i] == b[j]) && !(a[i] == L'*' && b[j] == L'*')) {
                todo.push_back(std::make_pair(a[i] == L'*' ? i : i + 1, b[j] == L'*' ? j : j + 1));
            }
        }
    }
    return false;
}

// FS_Cache2 keeps only the files --cache-files names, and answers from
// nothing else: a --name that no kept file can match answers nothing.
void warnAboutCachingSet(const Options& o, FsQuery& query) {
    if (o.cacheFiles.empty() || o.names.empty()) return;
    std::vector<std::wstring> kept = query.getMasksForCaching();
    for (const std::wstring& name : query.getFilesForCaching()) kept.push_back(name);
    std::string list;
    for (const std::string& m : o.cacheFiles) list += (list.empty() ? "'" : ", '") + m + "'";
    for (const std::string& name : o.names) {
        std::wstring mask = toWide(name);
        if (o.ignoreCase) utils::stringToLower(mask);
        bool meets = false;
        for (const std::wstring& k : kept) meets = meets || masksMeet(mask, k);
        if (!meets) {
            std::fprintf(stderr,
                         "fsquery: warning: --name '%s' matches no file that the cache keeps (--cache-files %s): "
                         "it answers nothing\n",
                         name.c_str(), list.c_str());
        }
    }
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
//
// A record is printed with what the answer holds: path, name, attributes,
// size, and the checksums asked for (--md5, --crc32, --q32), which only a
// regular file has.  The fields that need a status call (device, owner,
// inode, times, links) are printed only with --stat, and then read afresh
// together with size and attributes, so that one line never mixes what the
// cache holds with what the disk says now.
class Printer {
public:
    Printer(const Options& o, Progress& p) : options(o), progress(p) {
        buffer.reserve(kBufferBytes);
    }
    ~Printer() {
        if (heldFile >= 0) ::close(heldFile);
    }

    void header() {
        if (options.format != FORMAT_CSV) return;
        buffer += options.stat ? "path,name,fullPath,md5,sha256,attr,size,device,groupId,userId,iNode,"
                                 "lastAccessTime,createTime,lastModifyTime,linkCount,crc32,q32\n"
                               : "path,name,fullPath,md5,sha256,attr,size,crc32,q32\n";
        flushIfFull();
    }

    // The quick form: a record that is only a path and a name.
    void print(const wchar_t* path, const wchar_t* name) {
        if (options.format == FORMAT_NULL || broken) return;
        buffer += localDirectory(path);
        appendLocal(buffer, name);
        buffer.push_back(options.print0 ? '\0' : '\n');
        flushIfFull();
    }

    void print(FsFileInfo& info) {
        if (options.format == FORMAT_NULL || broken) return;
        std::string full = localDirectory(info.getPath());
        appendLocal(full, info.getName());
        bool regular = (info.getAttr() & FsFileInfo::ATTR_REGULAR) != 0;
        if (options.format == FORMAT_TEXT) {
            // Only a regular file has checksums: a line for a link, a device,
            // a pipe or a socket would be one that md5sum -c cannot read.
            if (!regular) return;
            if (options.md5) buffer += narrow(info.getMD5()) + "  ";
            if (options.crc32) buffer += hex8(info.getCRC32()) + "  ";
            if (options.q32) buffer += hex8(info.getQ32()) + "  ";
            buffer += full;
            buffer.push_back(options.print0 ? '\0' : '\n');
        } else if (options.format == FORMAT_JSON) {
            appendJson(info, regular);
        } else {
            appendCsv(info, full, regular);
        }
        flushIfFull();
    }

    // From now on output waits until release(): a query from the cache that
    // fails (a damaged cache, a refused write) must serve nothing.  Up to
    // kHeldInMemory bytes wait in memory, the rest in a file without a name
    // in directory.
    void hold(const std::string& directory) {
        holding = true;
        holdDirectory = directory;
    }
    // Writes what waited and ends the holding.
    void release() {
        flush();
        holding = false;
        if (heldFile >= 0) {
            char chunk[1 << 16];
            if (lseek(heldFile, 0, SEEK_SET) == 0) {
                ssize_t n;
                while ((n = read(heldFile, chunk, sizeof chunk)) > 0) write(chunk, static_cast<size_t>(n));
            }
            ::close(heldFile);
            heldFile = -1;
        }
        for (const std::string& chunk : held) write(chunk.data(), chunk.size());
        dropHeld();
    }
    // Drops what waited and ends the holding.
    void discard() {
        buffer.clear();
        dropHeld();
        if (heldFile >= 0) ::close(heldFile);
        heldFile = -1;
        holding = false;
    }

    // False when standard output failed for another reason than a closed
    // pipe (which ends the output quietly).
    bool finish() {
        flush();
        if (!broken && std::fflush(stdout) != 0) broken = (errno == EPIPE) ? 1 : 2;
        return broken != 2;
    }

private:
    static const size_t kHeldInMemory = 8u << 20;
    static const size_t kBufferBytes = 1u << 16;

    // The local form of a directory's path with a separator behind it
    // (nothing for an empty or absent path).  The hits of one directory
    // come one after another: the last one converted is kept and given
    // again while the path is the same.
    const std::string& localDirectory(const wchar_t* path) {
        if (path == nullptr || path[0] == L'\0') {
            noDirectory.clear();
            return noDirectory;
        }
        if (directoryKnown && std::wcscmp(path, directoryWide.c_str()) == 0) return directoryLocal;
        directoryWide.assign(path);
        directoryLocal.clear();
        appendLocal(directoryLocal, path);
        if (directoryLocal.back() != '/') directoryLocal.push_back('/');
        directoryKnown = true;
        return directoryLocal;
    }

    static std::string narrow(const wchar_t* text) {
        std::string out;
        appendLocal(out, text);
        return out;
    }

    // The checksum fields: a regular file's sums when asked for, else none.
    bool hasMd5(bool regular) const { return regular && options.md5; }
    bool hasCrc32(bool regular) const { return regular && options.crc32; }
    bool hasQ32(bool regular) const { return regular && options.q32; }

    // With --stat: the file's status read now, whole; null when it cannot be
    // read (the file is gone).
    bool freshStatus(const FsFileInfo& info, FsFileInfo& fresh) const {
        fresh.setFilePath(info.getPath());
        fresh.setFileName(info.getName());
        return fresh.updateInfo();
    }

    void appendJson(FsFileInfo& info, bool regular) {
        FsFileInfo fresh;
        bool status = options.stat && freshStatus(info, fresh);
        const FsFileInfo& source = status ? fresh : info;
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
        appendJsonString(buffer, hasMd5(regular) ? info.getMD5() : nullptr);
        buffer += ",\"sha256\":null";
        std::snprintf(numbers, sizeof numbers, ",\"attr\":%u,\"size\":%llu", source.getAttr(), source.getSize());
        buffer += numbers;
        if (options.stat) {
            if (status) {
                std::snprintf(numbers, sizeof numbers,
                              ",\"device\":%u,\"groupId\":%u,\"userId\":%u,\"iNode\":%u,\"lastAccessTime\":%ld,"
                              "\"createTime\":%ld,\"lastModifyTime\":%ld,\"linkCount\":%u",
                              fresh.getDevice(), fresh.getGroupId(), fresh.getUserId(), fresh.getINode(),
                              fresh.getLastAccessTime(), fresh.getCreateTime(), fresh.getLastModifyTime(),
                              fresh.getLinkCount());
                buffer += numbers;
            } else {
                buffer += ",\"device\":null,\"groupId\":null,\"userId\":null,\"iNode\":null,"
                          "\"lastAccessTime\":null,\"createTime\":null,\"lastModifyTime\":null,"
                          "\"linkCount\":null";
            }
        }
        buffer += ",\"crc32\":";
        buffer += hasCrc32(regular) ? std::to_string(info.getCRC32()) : "null";
        buffer += ",\"q32\":";
        buffer += hasQ32(regular) ? std::to_string(info.getQ32()) : "null";
        buffer += "}\n";
    }

    void appendCsv(FsFileInfo& info, const std::string& full, bool regular) {
        FsFileInfo fresh;
        bool status = options.stat && freshStatus(info, fresh);
        const FsFileInfo& source = status ? fresh : info;
        appendCsvField(buffer, narrow(info.getPath()));
        buffer.push_back(',');
        appendCsvField(buffer, narrow(info.getName()));
        buffer.push_back(',');
        appendCsvField(buffer, full);
        buffer.push_back(',');
        if (hasMd5(regular)) appendCsvField(buffer, narrow(info.getMD5()));
        buffer += ",";  // sha256: never computed
        char numbers[256];
        std::snprintf(numbers, sizeof numbers, ",%u,%llu", source.getAttr(), source.getSize());
        buffer += numbers;
        if (options.stat) {
            if (status) {
                std::snprintf(numbers, sizeof numbers, ",%u,%u,%u,%u,%ld,%ld,%ld,%u", fresh.getDevice(),
                              fresh.getGroupId(), fresh.getUserId(), fresh.getINode(), fresh.getLastAccessTime(),
                              fresh.getCreateTime(), fresh.getLastModifyTime(), fresh.getLinkCount());
                buffer += numbers;
            } else {
                buffer += ",,,,,,,,";
            }
        }
        buffer += ",";
        if (hasCrc32(regular)) buffer += std::to_string(info.getCRC32());
        buffer += ",";
        if (hasQ32(regular)) buffer += std::to_string(info.getQ32());
        buffer.push_back('\n');
    }

    void flushIfFull() {
        if (buffer.size() >= kBufferBytes - 4096) flush();
    }
    void flush() {
        if (buffer.empty()) return;
        if (holding) {
            keep(buffer);
        } else {
            write(buffer.data(), buffer.size());
        }
        buffer.clear();
    }
    void write(const char* data, size_t size) {
        if (broken || size == 0) return;
        progress.beforeOutput();
        if (std::fwrite(data, 1, size, stdout) != size) broken = (errno == EPIPE) ? 1 : 2;
    }
    // Output that waits: in memory, and past kHeldInMemory in the file.
    // In memory it waits as the buffers it came in, each taken over whole:
    // one string grown by doubling would copy all of it again at every
    // doubling and touch twice its size in new pages.
    void keep(std::string& text) {
        if (heldFile < 0 && heldSize + text.size() > kHeldInMemory) {
            heldFile = openHeldFile();
            bool copied = heldFile >= 0;
            for (size_t i = 0; copied && i < held.size(); ++i) copied = writeAll(heldFile, held[i]);
            if (heldFile >= 0 && !copied) {
                ::close(heldFile);
                heldFile = -1;
            }
            if (heldFile >= 0) dropHeld();
        }
        if (heldFile >= 0 && writeAll(heldFile, text)) return;
        heldSize += text.size();
        held.push_back(std::move(text));
        text = std::string();
        text.reserve(kBufferBytes);
    }
    // The buffers held in memory, and their count of bytes, go.
    void dropHeld() {
        held.clear();
        heldSize = 0;
    }
    int openHeldFile() const {
#ifdef O_TMPFILE
        int fd = open(holdDirectory.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
        if (fd >= 0) return fd;
#endif
        std::string name = holdDirectory + "/output-XXXXXX";
        std::vector<char> text(name.begin(), name.end());
        text.push_back('\0');
        int made = mkstemp(text.data());
        if (made >= 0) unlink(text.data());
        return made;
    }
    static bool writeAll(int fd, const std::string& text) {
        size_t done = 0;
        while (done < text.size()) {
            ssize_t n = ::write(fd, text.data() + done, text.size() - done);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) return false;
            done += static_cast<size_t>(n);
        }
        return true;
    }

    const Options& options;
    Progress& progress;
    std::string buffer;
    int broken = 0;  // 0 fine, 1 pipe closed, 2 write error
    bool holding = false;
    std::string holdDirectory;
    std::vector<std::string> held;
    size_t heldSize = 0;
    int heldFile = -1;
    bool directoryKnown = false;
    std::wstring directoryWide;
    std::string directoryLocal;
    std::string noDirectory;
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
        FsFileInfo info = fileInfoOf(path, name, size, attr, md5, crc32, q32);
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

// The name is made by creating the file: mkstemps picks a name nobody
// holds and creates it exclusively, so no other process and no link planted
// in the directory can take it between the choice and the creation.  The
// result set's writer then makes the file anew under that name.  Where the
// directory refuses even that, the name alone, and the writer's creation
// meets the same refusal.
char* tempNameInCache(char*) {
    const char kSuffix[] = ".tmp";
    std::snprintf(gTempName, sizeof gTempName, "%s/sort-%ld-XXXXXX%s", gTempDirectory.c_str(),
                  static_cast<long>(getpid()), kSuffix);
    int fd = mkstemps(gTempName, static_cast<int>(sizeof kSuffix - 1));
    if (fd >= 0) {
        close(fd);
        return gTempName;
    }
    std::snprintf(gTempName, sizeof gTempName, "%s/sort-%ld-%u.tmp", gTempDirectory.c_str(),
                  static_cast<long>(getpid()), gTempCounter++);
    return gTempName;
}

// SIGINT, SIGTERM and SIGHUP: removes the result file of a sort in progress
// and the sort's scratch files (the handlers unlink before they trace); the
// engine's own update flag tells the next run that this one did not finish.
// Installed with SA_RESETHAND and SA_NODEFER: the signal's own action is
// back in place on entry, so the raise ends the process, and so does a
// second signal should a handler never return.
void onTerminate(int signal) {
    // The cleanup handlers trace; the code this signal interrupted may be
    // writing a trace line under the trace lock, which the handler would
    // then wait for on this same thread.  The process is ending: no traces.
    QvLogWrapper::silenceForSignal();
    FsResourceManager::getInstance()->invokeCleanupHandlers(signal);
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

// Files and directories read so far, from the statistics record of the query
// under way; its counter may be read while the query thread counts.
long long countScannedEntries(const void* source) {
    return static_cast<const FsQueryStatistics*>(source)->entriesScanned();
}

struct RunStats {
    std::string mode;
    // The engine's record of the query: the cache object's, or the one the
    // direct walk filled.
    FsQueryStatistics record;
};

// A path as the system gave it, fit for a terminal: characters of the locale
// stay, a byte that is not one (a name written in another encoding) or a
// control character is written \xHH, and a backslash \\.
std::string printablePath(const std::string& bytes) {
    std::string out;
    std::mbstate_t state = std::mbstate_t();
    size_t i = 0;
    while (i < bytes.size()) {
        wchar_t c = 0;
        size_t n = std::mbrtowc(&c, bytes.data() + i, bytes.size() - i, &state);
        if (n == static_cast<size_t>(-1) || n == static_cast<size_t>(-2) || n == 0 || std::iswcntrl(c)) {
            char hex[8];
            std::snprintf(hex, sizeof hex, "\\x%02x", static_cast<unsigned char>(bytes[i]));
            out += hex;
            state = std::mbstate_t();
            ++i;
            continue;
        }
        if (c == L'\\') out += "\\\\";
        else out.append(bytes, i, n);
        i += n;
    }
    return out;
}

// One line on standard error for each cause of skipped entries, with the
// first paths the engine kept, as find tells of what it could not read.
void reportSkipped(const FsQueryStatistics& record) {
    for (int cause = 0; cause < FsQueryStatistics::SKIP_CAUSES; ++cause) {
        const FsQueryStatistics::SkippedEntries& entries = record.skipped[cause];
        if (entries.count <= 0) continue;
        bool one = entries.count == 1;
        std::string what;
        switch (cause) {
        case FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY:
            what = one ? "directory that could not be read" : "directories that could not be read";
            break;
        case FsQueryStatistics::SKIP_UNDECODABLE_NAME: {
            const char* codeset = nl_langinfo(CODESET);
            what = std::string(one ? "entry whose name is" : "entries whose names are") +
                   " not valid in the locale's encoding (" + (codeset != nullptr ? codeset : "?") + ")";
            break;
        }
        case FsQueryStatistics::SKIP_PATH_TOO_LONG:
            what = std::string(one ? "entry" : "entries") + " past the path limit of 4095 characters";
            break;
        default:
            what = one ? "entry whose status could not be read (kept as an empty file)"
                       : "entries whose status could not be read (kept as empty files)";
            break;
        }
        std::string line = "fsquery: skipped " + std::to_string(entries.count) + " " + what +
                           (one ? ", and everything below it: " : ", and everything below them: ");
        for (size_t i = 0; i < entries.paths.size(); ++i) {
            if (i > 0) line += ", ";
            line += "'" + printablePath(entries.paths[i]) + "'";
            int error = i < entries.errors.size() ? entries.errors[i] : 0;
            if (error != 0) line += std::string(" (") + std::strerror(error) + ")";
        }
        long long more = entries.count - static_cast<long long>(entries.paths.size());
        if (more > 0) line += " and " + std::to_string(more) + " more";
        std::fprintf(stderr, "%s\n", line.c_str());
    }
}

// ------------------------------------------------------------ resolution

// The query's paths resolved as the engine's query flow resolves them at
// the start of a query: the drive list of the mount table and the
// automounter maps, pruned by the query's file systems and exclude paths;
// the included paths resolved against it for the local drive group, the
// excluded ones for every drive; and the path lists the flow takes from
// them.  Both modes of the tool start from this one resolution: the cache's
// own flow arrives at the same lists.
struct Resolution {
    std::vector<DriveInfo> drives;         // every drive, before pruning
    std::vector<DriveInfo> pruned;         // the drives the file systems leave
    std::vector<PathDrive> roots;          // scan roots, sorted by path
    std::vector<PathDrive> resolved;       // the included paths as meant
    std::vector<PathDrive> excludeResolved;
    std::vector<PathInfo> localIncludes;
    std::vector<PathInfo> localExcludes;
    std::vector<PathInfo> remoteIncludes;
};

void buildDrives(const FsQuery& query, std::vector<DriveInfo>& drives) {
    DriveHelper driveHelper;
    driveHelper.setAssumeAutoFSDriveType(query.getAssumeAutoFSDriveType());
    driveHelper.buildDriveList(drives, mdAllDrives);
}

// pruneFileSystems false: the drives are not pruned (for telling whether a
// path names anything at all, whatever the filters leave of it).  drives, when
// given, is the drive list to use instead of reading the mount table again.
void resolveQuery(const FsQuery& query, Resolution& r, bool pruneFileSystems = true,
                  const std::vector<DriveInfo>* drives = nullptr) {
    bool caseFlag = query.getCaseSensitive();
    if (drives != nullptr) r.drives = *drives;
    else buildDrives(query, r.drives);
    std::vector<PathInfo> included = query.getIncludedPaths();
    std::vector<PathInfo> excluded = query.getExcludedPaths();
    if (pruneFileSystems) {
        std::vector<FileSystemInfo> includedFs = query.getIncludedFileSystems();
        std::vector<FileSystemInfo> excludedFs = query.getExcludedFileSystems();
        DriveHelper driveHelper;
        driveHelper.fileSystemDriveListPruning(r.drives, r.pruned, includedFs, excludedFs, caseFlag, excluded);
    } else {
        r.pruned = r.drives;
    }
    PathHelper pathHelper(1);
    std::vector<PathInfo> drivePaths, prunedPaths, droppedPaths;
    pathHelper.buildPathList(r.drives, drivePaths);
    pathHelper.buildPathList(r.pruned, prunedPaths);
    pathHelper.differencePathList(drivePaths, prunedPaths, droppedPaths);
    std::vector<PathDrive> excludedOut, unresolved, exParents, exExcluded, exUnresolved;
    pathHelper.pathResolver(included, r.pruned, prunedPaths, droppedPaths, r.roots, r.resolved, excludedOut,
                            unresolved, mdLocalDriveGroup);
    pathHelper.pathResolver(excluded, r.pruned, prunedPaths, droppedPaths, exParents, r.excludeResolved,
                            exExcluded, exUnresolved, mdAllDrives);
    pathHelper.extractPathList(r.resolved, mdLocalDriveGroup, r.localIncludes);
    pathHelper.extractPathList(r.excludeResolved, mdLocalDriveGroup, r.localExcludes);
    pathHelper.extractPathList(r.resolved, mdRemoteDriveGroup, r.remoteIncludes);
    pathHelper.extractPathList(r.resolved, mdOtherDriveGroup, r.remoteIncludes);
}

bool isLocalRoot(const PathDrive& root) {
    return (static_cast<unsigned int>(root.getDriveType()) & mdLocalDriveGroup) != 0;
}

// A directory path as the walks hand it over, without its final separator.
std::wstring directoryOf(const wchar_t* path) {
    std::wstring d = path != nullptr ? path : L"";
    while (d.size() > 1 && d.back() == L'/') d.pop_back();
    return d;
}

// An existing path given literally whose name holds "*" or "?": the query
// reads those as wildcards, so the hits are held to this path.
struct LiteralPath {
    std::wstring path;  // absolute, without a final separator
    bool recursive;
};

// ------------------------------------------------------------- hits

// The tool's --timeout as one budget for the whole run.  The engine gives
// each of its steps the timeout it is handed, counted from the step's own
// start (each cache build, then the extraction), so the tool hands every
// call only what is left, and holds the hits to the end of the budget.
class Deadline {
public:
    explicit Deadline(unsigned int budgetMs)
        : budget(budgetMs), end(std::chrono::steady_clock::now() + std::chrono::milliseconds(budgetMs)) {}
    // Milliseconds left, 0 once the budget is spent.
    unsigned int remainingMs() const {
        long long left = std::chrono::duration_cast<std::chrono::milliseconds>(
                             end - std::chrono::steady_clock::now()).count();
        if (left <= 0) return 0;
        return left < static_cast<long long>(budget) ? static_cast<unsigned int>(left) : budget;
    }
    bool passed() const { return std::chrono::steady_clock::now() >= end; }

private:
    unsigned int budget;
    std::chrono::steady_clock::time_point end;
};

// Stands between the library and the tool's output, so that a hit comes out
// the same whichever way the query was answered.
//
// Records of a walk (the FsFileInfo form: the direct walk, and in cache mode
// the roots on remote drives) get here what the cache's extraction does for
// its rows: the checksums asked for, and the known-checksum filter, with
// the sums of a regular file read once; a link, device, pipe or socket has
// none (zero sums).  With --no-cache, the records of a local root are kept
// or left out a directory at a time by the extraction's rules (see
// includeDirectory), and a directory that an earlier root already answered
// for is not answered again: the cache holds one tree per path.
//
// Rows of the cache's extraction pass as they are.  Every record is held to
// the literal paths, when the query has any.
class HitFilter : public FsResultSetWriter {
public:
    HitFilter(FsResultSetWriter& t, const Options& o, FileHashBlackBox* h, bool cs)
        : target(t), options(o), hashes(h), caseFlag(cs) {}

    // With --no-cache: the resolution whose rules the local roots follow.
    void answerLikeTheCache(Resolution* r) { resolution = r; }
    // Literal paths, and the include paths of the query's other paths.
    void holdToLiteralPaths(const std::vector<LiteralPath>& literal, const std::vector<PathInfo>& others) {
        literalPaths = literal;
        otherIncludes = others;
    }
    // Brackets one root of the direct walk.
    void beginRoot(bool localRoot) {
        local = localRoot;
        lastDirectory.clear();
        haveDecision = false;
    }
    void endRoot() {
        answeredBefore.insert(answeredNow.begin(), answeredNow.end());
        answeredNow.clear();
        haveDecision = false;
    }

    // The tool's one time budget, which the engine's calls each count
    // afresh: past it every hit is refused and the run has run out of time.
    void keepTo(const Deadline* d) { deadline = d; }
    bool overran() const { return overrun; }

    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int attr,
                  const wchar_t* md5, unsigned int crc32, unsigned int q32) override {
        if (pastDeadline()) return 0;
        if (!literalPaths.empty() && !decide(path, false)) return 0;
        return target.addRecord(path, name, size, attr, md5, crc32, q32);
    }
    int addRecord(const FsFileInfo& info) override {
        if (pastDeadline()) return 0;
        bool walkRules = resolution != nullptr && local;
        if ((walkRules || !literalPaths.empty()) && !decide(info.getPath(), walkRules)) return 0;
        bool regular = (info.getAttr() & FsFileInfo::ATTR_REGULAR) != 0;
        bool wantSums = options.md5 || options.crc32 || options.q32;
        if (!wantSums && hashes == nullptr) return target.addRecord(info);
        FsFileInfo copy(info);
        FileChecksumInfo sums;
        if (options.md5 || hashes != nullptr) sums.flags |= FILE_CHECKSUM_MD5;
        if (options.crc32) sums.flags |= FILE_CHECKSUM_CRC32;
        if (options.q32) sums.flags |= FILE_CHECKSUM_Q32;
        if (regular) {
            std::string full;
            appendLocal(full, info.getPath());
            if (!full.empty() && full.back() != '/') full.push_back('/');
            appendLocal(full, info.getName());
            if (computeRegularFileChecksumInfo(sums, full.c_str()) != 0) {
                // As the cache keeps it: a file that cannot be read has zero sums.
                sums.crc32 = 0;
                sums.q32 = 0;
                sums.md5 = u_int128();
            }
        }
        if (hashes != nullptr && !hashes->find(sums)) return 0;
        if (regular) {
            if (options.md5) {
                wchar_t text[MD5_TEXT_SIZE];
                md52wchar_t(sums.md5, text);
                copy.setMD5(text);
            }
            if (options.crc32) copy.setCRC32(sums.crc32);
            if (options.q32) copy.setQ32(sums.q32);
        }
        return target.addRecord(copy);
    }
    int close() override { return target.close(); }

private:
    // Checked at every hit, as the engine checks its budget at every
    // matching row.
    bool pastDeadline() {
        if (!overrun && deadline != nullptr && deadline->passed()) overrun = true;
        return overrun;
    }

    // The decision about the files of one directory; records of a directory
    // come together, so it is made about once per directory.
    bool decide(const wchar_t* path, bool walkRules) {
        std::wstring directory = directoryOf(path);
        if (haveDecision && directory == lastDirectory) return lastDecision;
        bool keep = literalPaths.empty() || withinLiteralPaths(directory);
        if (keep && walkRules) {
            if (answeredBefore.count(directory) != 0) {
                keep = false;
            } else {
                keep = includeDirectory(directory);
                if (keep) answeredNow.insert(directory);
            }
        }
        lastDirectory = directory;
        lastDecision = keep;
        haveDecision = true;
        return keep;
    }

    // The cache's extraction decides so for each directory of its rows: it
    // lies below a local root, outside the mounts that root's walk must not
    // enter, inside an included path and outside every excluded one.  An
    // exclude path thus leaves out directories, never a single file.
    bool includeDirectory(const std::wstring& directory) {
        Resolution& r = *resolution;
        int index = checkPathDriveListEx(directory.c_str(), r.roots, mdLocalDriveGroup, caseFlag);
        if (index < 0) return false;
        auto found = rootExcludes.find(index);
        if (found == rootExcludes.end()) {
            std::vector<PathInfo> excludes;
            PathHelper pathHelper(1);
            pathHelper.buildExcludeList(r.drives, r.roots[static_cast<size_t>(index)], excludes);
            found = rootExcludes.emplace(index, excludes).first;
        }
        if (!found->second.empty() && checkPathList(directory.c_str(), found->second, caseFlag, false)) return false;
        if (!checkPathList(directory.c_str(), r.localIncludes, caseFlag, false)) return false;
        if (!r.localExcludes.empty() && checkPathList(directory.c_str(), r.localExcludes, caseFlag, false))
            return false;
        return true;
    }

    bool withinLiteralPaths(const std::wstring& directory) const {
        for (const LiteralPath& l : literalPaths) {
            size_t n = l.path.size();
            bool same = caseFlag ? directory.compare(0, n, l.path) == 0
                                 : wcsncasecmp(directory.c_str(), l.path.c_str(), n) == 0;
            if (!same || directory.size() < n) continue;
            if (directory.size() == n) return true;
            if (l.recursive && (directory[n] == L'/' || l.path == L"/")) return true;
        }
        return !otherIncludes.empty() && checkPathList(directory.c_str(), otherIncludes, caseFlag, false);
    }

    FsResultSetWriter& target;
    const Options& options;
    FileHashBlackBox* hashes;
    bool caseFlag;
    Resolution* resolution = nullptr;
    bool local = true;
    std::vector<LiteralPath> literalPaths;
    std::vector<PathInfo> otherIncludes;
    std::map<int, std::vector<PathInfo>> rootExcludes;
    std::set<std::wstring> answeredBefore;
    std::set<std::wstring> answeredNow;
    std::wstring lastDirectory;
    bool lastDecision = false;
    bool haveDecision = false;
    const Deadline* deadline = nullptr;
    bool overrun = false;
};

// An exclude path that only ever names a directory: the direct walk may
// leave it out before entering it, as the cache's scan does, without
// leaving out a file that the cache would keep.
bool excludesOnlyADirectory(const PathInfo& p) {
    const wchar_t* name = p.getPathName();
    if (name == nullptr || checkWildCard(name)) return false;
    std::string narrowName;
    appendLocal(narrowName, name);
    struct stat st;
    return lstat(narrowName.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

// The direct walk answers as the cache does: the roots and lists of the
// same resolution, each tree walked by fs_build.  A root on a remote drive
// is walked as the cache's flow walks it; the hits of a local root pass the
// extraction's rules in the filter.
int runDirectWalk(FsQuery& query, HitFilter& filter, const Deadline& deadline, Resolution& r, RunStats& stats) {
    bool caseFlag = query.getCaseSensitive();
    CpuThreshold::Initialize(query.getCpuThreshold());
    PathHelper pathHelper(1);
    filter.answerLikeTheCache(&r);
    int result = SUCCESS;
    for (size_t i = 0; i < r.roots.size(); ++i) {
        CpuThreshold::doIteration();
        PathDrive root = r.roots[i];
        bool local = isLocalRoot(root);
        // A path on two drives is one tree in the cache, the one its last
        // visit built: walk it once, on the last of its drives.
        bool again = false;
        for (size_t j = i + 1; local && j < r.roots.size() && !again; ++j) {
            again = isLocalRoot(r.roots[j]) && root.getPathName() != nullptr &&
                    r.roots[j].getPathName() != nullptr &&
                    wcscmp(root.getPathName(), r.roots[j].getPathName()) == 0;
        }
        if (again) continue;
        std::vector<PathInfo> excludes;
        if (local) {
            pathHelper.buildExcludeList(r.drives, root, excludes);
            std::vector<PathInfo> asked;
            pathHelper.fillExclude(root, r.excludeResolved, asked);
            for (const PathInfo& p : asked) {
                if (excludesOnlyADirectory(p)) excludes.push_back(p);
            }
        } else {
            pathHelper.extractPathList(r.excludeResolved, mdRemoteDriveGroup, excludes);
            pathHelper.extractPathList(r.excludeResolved, mdOtherDriveGroup, excludes);
            pathHelper.buildExcludeList(r.drives, root, excludes);
            pathHelper.fillExclude(root, r.excludeResolved, excludes);
        }
        // Each walk gets what is left of the run's budget.
        long left = static_cast<long>(deadline.remainingMs());
        // No checksums and no known-checksum set here: the filter computes
        // them as the cache does.
        FileProcessor processor(query.getQuery(), caseFlag);
        ++stats.record.rootsWalked;
        filter.beginRoot(local);
        int walked = fs_build(filter, processor, root, local ? r.localIncludes : r.remoteIncludes, excludes,
                              caseFlag, static_cast<int>(left), &stats.record);
        filter.endRoot();
        if (walked == FS_SCAN_TIMED_OUT || filter.overran()) {
            result = SCAN_TIMED_OUT;
            break;
        }
    }
    return result;
}

// The tool's own lock on one cache directory: flock on the file
// "fsquery.lock" in it, held from before the cache object is made until after
// it is destroyed, so that two runs never use one cache at the same time.
// The engine's lock cannot do this alone: destroying any lock object removes
// the engine's lock file, also that of a run that gave up waiting, and a run
// that comes after it locks a new file beside a build still under way.  This
// file is never removed; a run that dies gives its lock up with its
// descriptor.
class ToolLock {
public:
    ToolLock() {}
    ~ToolLock() { release(); }
    ToolLock(const ToolLock&) = delete;
    ToolLock& operator=(const ToolLock&) = delete;

    // SUCCESS once held; CACHE_LOCK_TIMED_OUT when another process still
    // held it after waitMs; CACHE_ERROR when the file cannot be opened or
    // locked (errno says why).
    int acquire(const std::string& directory, int waitMs) {
        std::string name = directory + "/fsquery.lock";
        fd = open(name.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        if (fd < 0) return CACHE_ERROR;
        auto start = std::chrono::steady_clock::now();
        while (true) {
            if (flock(fd, LOCK_EX | LOCK_NB) == 0) return SUCCESS;
            if (errno == EINTR) continue;
            if (errno != EWOULDBLOCK) {
                int reason = errno;
                release();
                errno = reason;
                return CACHE_ERROR;
            }
            long long waited = std::chrono::duration_cast<std::chrono::milliseconds>(
                                   std::chrono::steady_clock::now() - start).count();
            if (waited >= waitMs) {
                release();
                return CACHE_LOCK_TIMED_OUT;
            }
            long long pause = std::min<long long>(20, waitMs - waited);
            std::this_thread::sleep_for(std::chrono::milliseconds(pause));
        }
    }
    // Gives the lock up (closing the descriptor does); the file stays.
    void release() {
        if (fd >= 0) ::close(fd);
        fd = -1;
    }

private:
    int fd = -1;
};

// One query through a cache object of the given kind, bracketed as a host
// must: lock, create, query, unlock, close.  The object lives on the stack:
// the base class has no virtual destructor.
template <typename CacheType>
int queryThroughCache(FsQuery& query, HitFilter& writer, const Deadline& deadline, const Options& o, FsGlue& glue,
                      const std::string& directory, Progress& progress, std::atomic<long long>* hits,
                      RunStats& stats) {
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
    errno = 0;
    result = cache.create(deadline.remainingMs(), FS_CACHE_OPEN_ALWAYS);
    if (result != SUCCESS) {
        // The engine leaves the reason its tables could not be made in errno.
        int reason = errno;
        std::fprintf(stderr, "fsquery: cannot open the cache %s: %s (%d)%s%s\n", directory.c_str(),
                     resultName(result), result, reason != 0 ? ": " : "",
                     reason != 0 ? std::strerror(reason) : "");
    } else {
        progress.start(countScannedEntries, &cache.lastQueryStatistics(), hits);
        result = cache.executeQueryEx(writer, query, deadline.remainingMs(), o.maxAge);
        int reason = errno;  // why a cache error happened: a refused write
        // The engine counted its budget afresh for each step; a hit that
        // came after the run's own end means the run ran out of time.
        if (result == SUCCESS && writer.overran()) result = SCAN_TIMED_OUT;
        progress.finish();
        stats.record = cache.lastQueryStatistics();
        if (result == CACHE_ERROR) {
            std::fprintf(stderr, "fsquery: %s (%d): cannot write the cache %s: %s\n", resultName(result),
                         result, directory.c_str(), std::strerror(reason));
        } else if (result != SUCCESS) {
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

// The path without its final separators ("/" stays).
std::string withoutFinalSeparator(const std::string& path) {
    std::string p = path;
    while (p.size() > 1 && p.back() == '/') p.pop_back();
    return p;
}

// Lexical absolute form: "." and ".." settled, links not followed.
std::string absoluteLexical(const std::string& path) {
    PathHelper pathHelper(1);
    wchar_t* real = pathHelper.realPath(toWide(path).c_str(), false);
    if (real == nullptr) return path;
    std::string out;
    appendLocal(out, real);
    kelm_free(real);
    return out;
}

// What the query receives for the PATH arguments, and what the tool holds
// the hits to.
struct PathPlan {
    std::vector<std::string> handed;       // include paths for the query
    std::vector<bool> recursive;           // their recursive flags
    std::vector<LiteralPath> literal;      // existing paths whose names hold * or ?
    std::vector<std::string> others;       // the handed paths that are not such
    std::vector<DriveInfo> drives;         // the drive list, read once for the run
};

// How a PATH is read:
//  - A path that exists is taken literally, whatever characters its name
//    holds.  A symbolic link is followed here (the query never follows one),
//    so that `fsquery /bin` lists what /bin points to.  A ":" in it is kept
//    from the path syntax by naming its drive first ("/:/tmp/co:lon"); a "*"
//    or "?" cannot be kept from being a wildcard, so the query gets it as a
//    mask and the tool holds the hits to the literal path.
//  - Any other path takes the path syntax ([MEDIA::][DRIVE:]PATH).
// Each path must name at least one existing directory: a path that names
// none is a usage error; one that names only something else (a file, a
// device) is left out with a warning.
int planPaths(const Options& o, PathPlan& plan) {
    std::vector<DriveInfo>& drives = plan.drives;
    FsQuery defaults;
    buildDrives(defaults, drives);
    for (const std::string& given : o.paths) {
        std::string path = given;
        bool plain = pathLooksPlain(given);
        struct stat st;
        bool exists = lstat(withoutFinalSeparator(given).c_str(), &st) == 0;
        if (plain && !exists) {
            std::fprintf(stderr, "fsquery: '%s': %s\n", given.c_str(), std::strerror(errno));
            return EXIT_USAGE;
        }
        bool literalWildcard = false;
        std::string absolute;
        if (exists) {
            path = absoluteLexical(given);
            if (S_ISLNK(st.st_mode)) {
                char* real = realpath(given.c_str(), nullptr);
                if (real != nullptr) {
                    path = real;
                    std::free(real);
                }
            }
            struct stat target;
            if (stat(path.c_str(), &target) != 0 || !S_ISDIR(target.st_mode)) {
                std::fprintf(stderr, "fsquery: warning: '%s' is not a directory: nothing below it is listed\n",
                             given.c_str());
                continue;
            }
            literalWildcard = path.find('*') != std::string::npos || path.find('?') != std::string::npos;
            absolute = path;
            if (path.find(':') != std::string::npos) {
                // Named drive first: the deepest mount that holds the path and
                // that the query's local media reaches.
                std::string best;
                for (const DriveInfo& d : drives) {
                    if (d.getDriveName() == nullptr ||
                        (static_cast<unsigned int>(d.getDriveType()) & mdLocalDriveGroup) == 0) {
                        continue;
                    }
                    std::string name;
                    appendLocal(name, d.getDriveName());
                    std::string mount = withoutFinalSeparator(name.substr(0, name.size() - 1));
                    bool holds = mount == "/" || path == mount || path.compare(0, mount.size() + 1, mount + "/") == 0;
                    if (holds && name.size() > best.size()) best = name;
                }
                if (best.empty()) {
                    std::fprintf(stderr, "fsquery: '%s' lies on no local drive of the mount table\n", given.c_str());
                    return EXIT_USAGE;
                }
                path = best + path;
            }
        }
        {
            // What the query makes of the path: at least one existing
            // directory, on the drives before any file system filter.
            FsQuery alone;
            if (o.ignoreCase) alone.setCaseSensitive(1);
            alone.addIncludePath(toWide(path).c_str(), !o.nonRecursive);
            Resolution r;
            resolveQuery(alone, r, false, &drives);
            int directories = 0, others = 0;
            std::string missing;
            for (const PathDrive& root : r.roots) {
                std::string rootPath;
                appendLocal(rootPath, root.getPathName());
                struct stat rs;
                if (lstat(withoutFinalSeparator(rootPath).c_str(), &rs) != 0) {
                    if (missing.empty()) missing = rootPath;
                } else if (S_ISDIR(rs.st_mode)) {
                    ++directories;
                } else {
                    ++others;
                }
            }
            if (directories == 0 && others == 0) {
                if (r.roots.empty()) {
                    std::fprintf(stderr, "fsquery: '%s' names no directory: no drive of the mount table answers it\n",
                                 given.c_str());
                } else {
                    std::fprintf(stderr, "fsquery: '%s' names no directory: '%s' does not exist\n", given.c_str(),
                                 missing.c_str());
                }
                return EXIT_USAGE;
            }
            if (directories == 0) {
                std::fprintf(stderr, "fsquery: warning: '%s' names no directory (only a file or a symbolic "
                             "link, which the query does not follow): nothing below it is listed\n",
                             given.c_str());
                continue;
            }
        }
        plan.handed.push_back(path);
        // A mask reaches into a directory only recursively; the literal
        // path then keeps the hits to its own directory.
        plan.recursive.push_back(!o.nonRecursive || literalWildcard);
        if (literalWildcard) {
            plan.literal.push_back(LiteralPath{toWide(withoutFinalSeparator(absolute)), !o.nonRecursive});
        } else {
            plan.others.push_back(path);
        }
    }
    return EXIT_OK;
}

int run(const Options& o) {
    auto startTime = std::chrono::steady_clock::now();
    Deadline deadline(o.timeoutMs);
    // The configuration comes first, so that its trace settings are the ones
    // the trace handle finds.
    if (!o.configFile.empty() && !KelCfg::loadFile(o.configFile.c_str())) {
        // The store's reason names the file already.
        std::string reason = static_cast<const char*>(KelCfg::getError());
        if (reason.empty()) reason = "cannot read configuration file '" + o.configFile + "'";
        std::fprintf(stderr, "fsquery: %s\n", reason.c_str());
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

    PathPlan plan;
    int planned = planPaths(o, plan);
    if (planned != EXIT_OK) return planned;

    // The query.
    FsQuery query;
    if (o.ignoreCase) query.setCaseSensitive(1);
    for (size_t i = 0; i < plan.handed.size(); ++i) {
        query.addIncludePath(toWide(plan.handed[i]).c_str(), plan.recursive[i]);
    }
    for (const std::string& p : o.excludes) {
        // An exclude path leaves directories out; a file is never left out
        // on its own (the cache's extraction decides by directory).
        struct stat st;
        if (lstat(withoutFinalSeparator(p).c_str(), &st) == 0 && !S_ISDIR(st.st_mode)) {
            std::fprintf(stderr, "fsquery: warning: --exclude '%s' is not a directory: it leaves nothing out\n",
                         p.c_str());
        }
        query.addExcludePath(toWide(p).c_str(), true);
    }
    for (const std::string& f : o.includeFs) query.addIncludeFileSystem(toWide(f).c_str());
    for (const std::string& f : o.excludeFs) query.addExcludeFileSystem(toWide(f).c_str());
    for (const std::string& m : o.cacheFiles) query.addFileOrMaskForCaching(toWide(m).c_str());
    if (!o.cpu.empty()) query.setCpuThreshold(o.cpu.c_str());
    std::wstring expression = toWide(buildExpression(o));
    ExpressionCheck check = checkExpression(expression);
    if (!check.ok) {
        std::string text;
        appendLocal(text, expression.c_str());
        std::string reason = check.reason;
        std::string unknown = unknownColumn(expression);
        if (!unknown.empty()) {
            reason += (reason.empty() ? "" : ": ") + std::string("'") + unknown +
                      "' is not a column (FILENAME, ATTR, SIZE, PATHID, MD5, CRC32, Q32); a text is written in "
                      "double quotes";
        }
        std::fprintf(stderr, "fsquery: invalid expression '%s'%s%s%s\n", text.c_str(), reason.empty() ? "" : " (",
                     reason.c_str(), reason.empty() ? "" : ")");
        return EXIT_USAGE;
    }
    if (o.noCache) {
        std::string refusal = cacheOnlyColumn(expression);
        if (!refusal.empty()) {
            std::fprintf(stderr, "fsquery: %s (see fsquery --help)\n", refusal.c_str());
            return EXIT_USAGE;
        }
    }
    query.setQuery(expression.c_str());
    warnAboutCachingSet(o, query);

    FileHashBlackBox hashes;
    for (const std::string& hex : o.knownMd5) hashes.insert_md5(char2md5(hex.c_str()));

    // The cache directory; also home of the sort file in --no-cache mode,
    // which needs none otherwise: without one its sort file goes to $TMPDIR.
    std::string base = o.cacheDir.empty() ? defaultCacheDirectory() : o.cacheDir;
    if (base.empty() && o.noCache) {
        const char* tmp = std::getenv("TMPDIR");
        base = (tmp != nullptr && tmp[0] == '/') ? tmp : "/tmp";
    }
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
    Printer printer(o, progress);
    bool quickText = o.format == FORMAT_NULL ||
                     (o.format == FORMAT_TEXT && !o.md5 && !o.crc32 && !o.q32);
    PrintingWriter printing(printer, quickText);
    FsResultSet_OnFile* resultFile = nullptr;
    CountingWriter* counting = nullptr;
    FsResultSetWriter* output = &printing;
    std::atomic<long long>* hits = &printing.hits;
    if (o.sortKey != 0) {
        gTempDirectory = directory;
        FsResultSet_OnFile::setTempNameSources(tempNameInCache, (directory + "/").c_str(),
                                               (directory + "/").c_str());
        resultFile = new FsResultSet_OnFile();
        counting = new CountingWriter(resultFile->getWriter());
        output = counting;
        hits = &counting->hits;
    }
    HitFilter filter(*output, o, hashes.empty() ? nullptr : &hashes, query.getCaseSensitive());
    filter.keepTo(&deadline);
    if (!plan.literal.empty()) {
        // The other paths' includes, as the query resolves them.
        FsQuery others;
        if (o.ignoreCase) others.setCaseSensitive(1);
        for (const std::string& p : plan.others) others.addIncludePath(toWide(p).c_str(), !o.nonRecursive);
        Resolution r;
        resolveQuery(others, r, true, &plan.drives);
        std::vector<PathInfo> includes;
        PathHelper(1).extractPathList(r.resolved, mdAllDrives | dtAutoFS, includes);
        filter.holdToLiteralPaths(plan.literal, includes);
    }
    printer.header();

    RunStats stats;
    int result = SUCCESS;
    if (plan.handed.empty()) {
        // Every path was left out (see the warnings): nothing to ask.
        stats.mode = "nothing to query";
    } else if (o.noCache) {
        stats.mode = "direct walk, no cache";
        progress.start(countScannedEntries, &stats.record, hits);
        Resolution resolution;
        resolveQuery(query, resolution, true, &plan.drives);
        result = runDirectWalk(query, filter, deadline, resolution, stats);
        progress.finish();
    } else {
        // An answer from the cache is printed once it is whole: a query that
        // fails serves nothing of what it found.
        printer.hold(directory);
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
        // The tool's lock is held until the cache object of the query is gone.
        ToolLock toolLock;
        result = toolLock.acquire(directory, o.lockWaitMs);
        if (result == CACHE_LOCK_TIMED_OUT) {
            std::fprintf(stderr,
                         "fsquery: the cache %s is locked by another process (waited %d ms; see --lock-wait)\n",
                         directory.c_str(), o.lockWaitMs);
        } else if (result != SUCCESS) {
            std::fprintf(stderr, "fsquery: cannot lock the cache %s: %s/fsquery.lock: %s\n", directory.c_str(),
                         directory.c_str(), std::strerror(errno));
        } else if (o.cacheFiles.empty()) {
            result = queryThroughCache<FS_Cache>(query, filter, deadline, o, glue, directory, progress, hits, stats);
        } else {
            result = queryThroughCache<FS_Cache2>(query, filter, deadline, o, glue, directory, progress, hits, stats);
        }
        toolLock.release();
        if (result == SUCCESS) printer.release();
        else printer.discard();
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
    reportSkipped(stats.record);

    // A run that never got the cache ran no query: there is nothing to tell.
    if (o.stats && result != CACHE_LOCK_TIMED_OUT) {
        double seconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - startTime).count();
        std::fprintf(stderr, "fsquery: mode: %s\n", stats.mode.c_str());
        const FsQueryStatistics& r = stats.record;
        if (o.noCache) {
            std::fprintf(stderr, "fsquery: roots: %d walked directly\n", r.rootsWalked);
            std::fprintf(stderr, "fsquery: scanned: %lld files\n", r.filesScanned);
            std::fprintf(stderr, "fsquery: scanned: %lld directories\n", r.directoriesScanned);
        } else {
            std::fprintf(stderr, "fsquery: roots: %d served from the cache, %d rebuilt", r.rootsFromCache,
                         r.rootsRebuilt);
            if (r.rootsWalked > 0) std::fprintf(stderr, ", %d walked directly", r.rootsWalked);
            std::fprintf(stderr, "\n");
            std::fprintf(stderr, "fsquery: scanned: %lld files, %lld directories\n", r.filesScanned,
                         r.directoriesScanned);
        }
        std::fprintf(stderr, "fsquery: skipped: %lld unreadable directories, %lld undecodable names, "
                     "%lld past the path limit, %lld without status\n",
                     r.skipped[FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY].count,
                     r.skipped[FsQueryStatistics::SKIP_UNDECODABLE_NAME].count,
                     r.skipped[FsQueryStatistics::SKIP_PATH_TOO_LONG].count,
                     r.skipped[FsQueryStatistics::SKIP_NO_STATUS].count);
        std::string lookup = check.indexColumn.empty() ? "every row" : "index on " + check.indexColumn;
        if (r.lookup == FsQueryStatistics::LOOKUP_INDEX) {
            std::string column;
            appendLocal(column, r.indexColumn.c_str());
            lookup = "index on " + column;
        } else if (r.lookup == FsQueryStatistics::LOOKUP_EVERY_ROW) {
            lookup = "every row";
        }
        std::fprintf(stderr, "fsquery: lookup: %s\n", lookup.c_str());
        std::fprintf(stderr, "fsquery: hits: %lld\n", hitTotal);
        std::fprintf(stderr, "fsquery: time: %.3f s\n", seconds);
    }
    if (!outputOk) {
        std::fprintf(stderr, "fsquery: cannot write the output: %s\n", std::strerror(errno));
        if (result == SUCCESS) return EXIT_FAILED;
    }
    if (result == SUCCESS && stats.record.skippedTotal() > 0) return EXIT_ENTRIES_SKIPPED;
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
    struct sigaction terminate;
    std::memset(&terminate, 0, sizeof terminate);
    terminate.sa_handler = onTerminate;
    sigemptyset(&terminate.sa_mask);
    terminate.sa_flags = SA_RESETHAND | SA_NODEFER;
    for (int s : {SIGINT, SIGTERM, SIGHUP}) sigaction(s, &terminate, nullptr);

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
