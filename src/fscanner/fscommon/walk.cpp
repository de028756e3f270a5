#include "fscanner/fscommon/walk.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <cwchar>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

// The walk reads directories and file status with large-file support: without
// it the 32-bit C library fails status calls with EOVERFLOW on 64-bit inode
// numbers and sizes of 2 GiB or more, and whole directories would drop out.
static_assert(sizeof(off_t) == 8 && sizeof(ino_t) == 8, "the library is built with _FILE_OFFSET_BITS=64");

namespace fscanner {

namespace {

// What the first pass decided for an entry, before any event is told.
enum Verdict : unsigned char {
    VISIT,
    SKIP_UNDECODABLE,
    SKIP_DOT,
    SKIP_TOO_LONG,
    SKIP_EXCLUDED,
};

// Where an entry's status comes from when it is visited.
enum StatusSource : unsigned char {
    STATUS_FULL_PATH,    // FsFileInfo::updateInfo: the call on the full path
    STATUS_TAKEN,        // fstatat on the directory's descriptor
    STATUS_DOT_IS_DIRECTORY,
};

// A getdents64 record: 64-bit inode and offset, record length, type, name.
struct DirectoryRecord {
    uint64_t inode;
    int64_t offset;
    unsigned short length;
    unsigned char type;
    char name[1];
};
const size_t kNameOffset = offsetof(DirectoryRecord, name);

// Room for one getdents64 call: as much as readdir(3) asks for.
const size_t kReadBufferBytes = 32768;

bool isDot(const wchar_t* name) {
    return name[0] == L'.' && (name[1] == 0 || (name[1] == L'.' && name[2] == 0));
}

// Grows the caller's conversion block to at least bytes; never shrinks it.
bool growConversion(const WalkConversionBuffer& buffer, size_t bytes) {
    if (*buffer.size >= bytes && *buffer.block != nullptr) return true;
    void* grown = kelm_realloc(*buffer.block, bytes);
    if (grown == nullptr) return false;
    *buffer.block = static_cast<char*>(grown);
    *buffer.size = bytes;
    return true;
}

}  // namespace

// Everything the walk keeps for one directory; one per depth, reused by
// every directory at that depth, so a walk allocates only while its tree
// still gets deeper or wider.
struct DirectoryWalker::Level {
    struct Entry {
        uint32_t nameAt;      // in names
        uint32_t nameBytes;
        uint32_t wideAt;      // in wide
        uint32_t nameLength;  // characters; 0 for an undecodable name
        Verdict verdict;
        StatusSource source;
    };
    std::string narrow;            // the directory's multibyte path
    std::vector<wchar_t> prefix;   // path, separator, room for a name
    std::vector<char> names;       // every name, NUL-terminated, read order
    std::vector<wchar_t> wide;     // every decoded name, NUL-terminated
    std::vector<Entry> entries;
    std::vector<struct stat> status;  // by entry, where source is STATUS_TAKEN

    Level() : prefix(DirectoryWalker::kMaxPath + 3) {}
};

DirectoryWalker::DirectoryWalker(WalkSink& sink, const WalkOptions& options)
    : sink_(sink), options_(options), readBuffer_(kReadBufferBytes), userId_(geteuid()) {}

DirectoryWalker::~DirectoryWalker() {
    for (Level* level : levels_) delete level;
}

int DirectoryWalker::walk(PathDrive& path, int timeoutMs, int64_t tag) {
    return walkDirectory(path, timeoutMs, tag, 0, nullptr);
}

int DirectoryWalker::readEntries(int fd, Level& level, int* error) {
    Env* env = Env::Current();
    level.names.clear();
    level.entries.clear();
    for (;;) {
        ssize_t filled = env->readDirectoryEntries(fd, readBuffer_.data(), readBuffer_.size());
        if (filled < 0) {
            // A read that broke off keeps what it read, as readdir(3) does.
            *error = errno;
            break;
        }
        if (filled == 0) break;
        size_t at = 0;
        while (at + kNameOffset < static_cast<size_t>(filled)) {
            const char* record = readBuffer_.data() + at;
            unsigned short length;
            std::memcpy(&length, record + offsetof(DirectoryRecord, length), sizeof length);
            if (length == 0) break;
            const char* name = record + kNameOffset;
            size_t bytes = strnlen(name, length - kNameOffset);
            Level::Entry entry{};
            entry.nameAt = static_cast<uint32_t>(level.names.size());
            entry.nameBytes = static_cast<uint32_t>(bytes);
            level.names.insert(level.names.end(), name, name + bytes);
            level.names.push_back('\0');
            level.entries.push_back(entry);
            at += length;
        }
    }
    return static_cast<int>(level.entries.size());
}

// Decides every entry before the first event (pure: no trace, no count), and
// takes the status of those that will be visited while the descriptor is
// open.
void DirectoryWalker::statusPass(int fd, Level& level, const WalkDirectory& directory,
                                 const struct stat* ownStatus) {
    Env* env = Env::Current();
    const size_t prefixLength = directory.prefixLength;
    // Bytes the full narrow path has before the name: a status call on a
    // path of more than kMaxPath bytes fails (ENAMETOOLONG), so such an
    // entry is left to the full-path call, which fails as it always did.
    const size_t narrowPrefix = level.narrow.size() + (prefixLength > directory.pathLength ? 1 : 0);
    wchar_t* full = level.prefix.data();
    const bool excludesBefore = options_.entryExcludes != nullptr && !options_.entryExcludes->empty();

    level.wide.clear();
    level.status.resize(level.entries.size());
    // Whether a lookup in this directory succeeds, and so the status of its
    // "." and "..": known when one has succeeded, or when the parent's
    // status of the directory says that we own it and may search it (the
    // owner's bits stand above any access list).  Otherwise asked below.
    bool searched = ownStatus != nullptr && ownStatus->st_uid == userId_ && (ownStatus->st_mode & S_IXUSR) != 0;
    for (size_t i = 0; i < level.entries.size(); ++i) {
        Level::Entry& entry = level.entries[i];
        entry.source = STATUS_FULL_PATH;
        const char* name = level.names.data() + entry.nameAt;
        // A name of n bytes has at most n characters.
        size_t at = level.wide.size();
        level.wide.resize(at + entry.nameBytes + 1);
        size_t n = mbstowcs(level.wide.data() + at, name, entry.nameBytes + 1);
        if (n == static_cast<size_t>(-1) || n == 0 || n >= entry.nameBytes + 1) {
            level.wide.resize(at);
            entry.verdict = SKIP_UNDECODABLE;
            continue;
        }
        level.wide.resize(at + n + 1);
        level.wide[at + n] = 0;
        entry.wideAt = static_cast<uint32_t>(at);
        entry.nameLength = static_cast<uint32_t>(n);
        const wchar_t* wideName = level.wide.data() + at;
        bool dot = isDot(wideName);
        if (dot && options_.dotsBeforeStatus) {
            entry.verdict = SKIP_DOT;
            continue;
        }
        bool fits = prefixLength + n <= kMaxPath;
        if (!fits && options_.lengthBeforeStatus) {
            entry.verdict = SKIP_TOO_LONG;
            continue;
        }
        if (excludesBefore && fits) {
            wmemcpy(full + prefixLength, wideName, n + 1);
            if (checkPathList(full, *options_.entryExcludes, options_.caseSensitive, true)) {
                entry.verdict = SKIP_EXCLUDED;
                continue;
            }
        }
        entry.verdict = VISIT;
        if (dot || narrowPrefix + entry.nameBytes > kMaxPath) continue;
        if (env->statusAt(fd, name, &level.status[i], AT_SYMLINK_NOFOLLOW) == 0) {
            entry.source = STATUS_TAKEN;
            searched = true;
        }
    }
    full[prefixLength] = 0;

    // "." and "..", when they are visited: the directory itself and its
    // parent, directories whenever the directory may be searched.
    for (size_t i = 0; i < level.entries.size(); ++i) {
        Level::Entry& entry = level.entries[i];
        if (entry.verdict != VISIT || !isDot(level.wide.data() + entry.wideAt)) continue;
        if (narrowPrefix + entry.nameBytes > kMaxPath) continue;
        if (searched) {
            entry.source = STATUS_DOT_IS_DIRECTORY;
        } else if (env->statusAt(fd, level.names.data() + entry.nameAt, &level.status[i],
                                 AT_SYMLINK_NOFOLLOW) == 0) {
            entry.source = STATUS_TAKEN;
        }
    }
}

int DirectoryWalker::walkDirectory(PathDrive& path, int timeoutMs, int64_t tag, int depth,
                                   const struct stat* ownStatus) {
    if (levels_.size() <= static_cast<size_t>(depth)) levels_.push_back(new Level);
    Level& level = *levels_[static_cast<size_t>(depth)];

    WalkDirectory directory{};
    directory.path = &path;
    directory.pathName = path.getPathName();
    directory.narrowPath = &level.narrow;
    directory.depth = depth;
    directory.tag = tag;

    if (timeoutMs < 1) {
        sink_.skipDirectory(directory, WalkSkip::TimedOut, 0);
        return FS_SCAN_TIMED_OUT;
    }
    const wchar_t* pathName = directory.pathName;
    if (pathName == nullptr) return FS_SCAN_DONE;
    size_t pathLength = wcslen(pathName);
    directory.pathLength = pathLength;
    if (pathLength > kMaxPath) {
        sink_.skipDirectory(directory, WalkSkip::PathTooLong, 0);
        return FS_SCAN_DONE;
    }

    // Three bytes per character and the end mark, in the owner's block.
    if (!growConversion(options_.conversion, pathLength * 3 + 1)) {
        sink_.skipDirectory(directory, WalkSkip::OutOfMemory, 0);
        return FS_SCAN_DONE;
    }
    char* conversion = *options_.conversion.block;
    size_t converted = wcstombs(conversion, pathName, *options_.conversion.size);
    if (converted == static_cast<size_t>(-1) || converted >= *options_.conversion.size) {
        sink_.skipDirectory(directory,
                            converted == static_cast<size_t>(-1) ? WalkSkip::NotConvertible
                                                                : WalkSkip::ConvertedTooLong,
                            0);
        return FS_SCAN_DONE;
    }
    conversion[converted] = '\0';
    level.narrow.assign(conversion, converted);

    wchar_t* prefix = level.prefix.data();
    wmemcpy(prefix, pathName, pathLength);
    size_t prefixLength = pathLength;
    if (prefixLength == 0 || prefix[prefixLength - 1] != PathHelper::PathSeparator) {
        prefix[prefixLength++] = PathHelper::PathSeparator;
    }
    prefix[prefixLength] = 0;
    directory.prefixLength = prefixLength;

    sink_.enterDirectory(directory);

    // Read whole and closed before the first entry is visited: no
    // descriptor stays open while the recursion goes down.  The sink hears
    // of the listing before any entry's status is taken, as it did when the
    // status calls were made entry by entry.
    Env* env = Env::Current();
    int readError = 0;
    int count = -1;
    int fd = env->openFile(level.narrow.c_str(), O_RDONLY | O_NONBLOCK | O_DIRECTORY | O_CLOEXEC);
    if (fd < 0) {
        readError = errno;
        getQvLogFs()->traceMIN(__LINE__, __FILE__, "scandir", "::scandir CAN'T OPEN %s dir, errno: %u ('%s')",
                               level.narrow.c_str(), static_cast<unsigned int>(readError), strerror(readError));
    } else {
        count = readEntries(fd, level, &readError);
        if (count == 0) {
            // Not even "." and "..": a directory removed after it was opened.
            errno = 0;
            env->closeFile(fd);
            if (readError == 0) readError = errno;
            count = -1;
        }
    }
    directory.readError = readError;
    if (count < 0) {
        sink_.skipDirectory(directory, WalkSkip::Unreadable, readError);
        sink_.leaveDirectory(directory, FS_SCAN_DONE);
        return FS_SCAN_DONE;
    }
    directory.listed = true;
    sink_.directoryListed(directory);
    unsigned int start = getTickCount();

    statusPass(fd, level, directory, ownStatus);
    errno = 0;
    if (env->closeFile(fd) != 0) {
        // A directory whose descriptor cannot be closed is given up as one
        // that could not be read.
        directory.listed = false;
        directory.readError = readError != 0 ? readError : errno;
        sink_.skipDirectory(directory, WalkSkip::Unreadable, directory.readError);
        sink_.leaveDirectory(directory, FS_SCAN_DONE);
        return FS_SCAN_DONE;
    }

    const bool recursive = path.getRecursive();
    int result = FS_SCAN_DONE;
    for (int i = count - 1; i >= 0; --i) {
        const Level::Entry& stored = level.entries[static_cast<size_t>(i)];
        WalkEntry entry{};
        entry.name = level.names.data() + stored.nameAt;
        entry.nameBytes = stored.nameBytes;
        if (stored.verdict == SKIP_UNDECODABLE) {
            sink_.skipEntry(directory, entry, WalkSkip::Undecodable);
            continue;
        }
        entry.wideName = level.wide.data() + stored.wideAt;
        entry.nameLength = stored.nameLength;
        entry.dot = isDot(entry.wideName);
        prefix[prefixLength] = 0;
        if (prefixLength + entry.nameLength <= kMaxPath) {
            wmemcpy(prefix + prefixLength, entry.wideName, entry.nameLength + 1);
            entry.fullPath = prefix;
        }
        if (stored.verdict != VISIT) {
            sink_.skipEntry(directory, entry,
                            stored.verdict == SKIP_DOT        ? WalkSkip::Dot
                            : stored.verdict == SKIP_TOO_LONG ? WalkSkip::PathTooLong
                                                              : WalkSkip::Excluded);
            continue;
        }

        FsFileInfo info;
        // The record's path is the directory with its separator.
        wchar_t saved = prefix[prefixLength];
        prefix[prefixLength] = 0;
        info.setFilePath(prefix);
        prefix[prefixLength] = saved;
        info.setFileName(entry.wideName);
        bool known = true;
        if (stored.source == STATUS_TAKEN) {
            info.setStatus(level.status[static_cast<size_t>(i)]);
        } else if (stored.source == STATUS_DOT_IS_DIRECTORY) {
            info.setFileAttr(FsFileInfo::ATTR_DIRECTORY);
        } else {
            known = info.updateInfo();
        }

        WalkVisit visit = sink_.visitEntry(directory, entry, info, known);
        if (!visit.descend || entry.fullPath == nullptr) continue;
        PathDrive child(entry.fullPath, recursive, static_cast<const DriveInfo&>(path));
        int remaining = timeoutMs - static_cast<int>(getTickCount() - start);
        const struct stat* childStatus =
            stored.source == STATUS_TAKEN ? &level.status[static_cast<size_t>(i)] : nullptr;
        int childResult = walkDirectory(child, remaining, visit.childTag, depth + 1, childStatus);
        if (childResult != FS_SCAN_DONE) {
            result = childResult;
            break;
        }
    }
    prefix[prefixLength] = 0;
    sink_.leaveDirectory(directory, result);
    return result;
}

// ------------------------------------------------------------------ helpers

bool dfsDecision(QvLogWrapper* log, const DfsTraceStyle& style, DfsLocalList& list, const char* narrowPath,
                 DriveType driveType) {
    const char* p = style.prefix;
    const char* e = style.end;
    const char* f = style.function;
    log->traceMAX(__LINE__, __FILE__, f, "%sget a path on 'dfs' filesystem%s", p, e);
    FileSystemHelper helper;
    char* fset = helper.dfs_mount(narrowPath);
    log->traceMAX(__LINE__, __FILE__, f, "%sfset value for '%s' path is %s%s", p, narrowPath,
                  fset != nullptr ? fset : "NULL", e);
    bool isLocal = true;
    if (fset != nullptr) {
        if (list.pending) {
            if (list.names == nullptr) list.names = new StringList<char>();
            list.loaded = helper.load_dfs_local(helper.dfs_hname(), *list.names) == 0;
            if (list.loaded) {
                log->traceMAX(__LINE__, __FILE__, f,
                              "%sload_dfs_local_retValue value is true: dfs local list loaded!%s",
                              style.loadPrefix, e);
            } else {
                log->traceMAX(__LINE__, __FILE__, f,
                              "%sload_dfs_local_retValue value is false: dfs local list not loaded!%s",
                              style.loadPrefix, e);
            }
            list.pending = false;
        }
        // Without the list every file set is asked about on its own; with it,
        // only a file set found in the list is asked.
        if (!list.loaded) {
            isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
        } else if (list.names->find(fset) >= 0) {
            isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
            log->traceMAX(__LINE__, __FILE__, f, "%s'%s' found in dfs local list%s", p, fset, e);
        } else {
            isLocal = false;
            log->traceMAX(__LINE__, __FILE__, f, "%s'%s' not found in dfs local list%s", p, fset, e);
        }
    }
    bool remote = driveType == dtRemote;
    bool addRecord = (!remote && isLocal) || (remote && !isLocal);
    log->traceMAX(__LINE__, __FILE__, f, "%sisLocal value for '%s' path is %s%s", p, narrowPath,
                  isLocal ? "true" : "false", e);
    log->traceMAX(__LINE__, __FILE__, f, "%sbAddRecord value for '%s' path is %s%s", p, narrowPath,
                  addRecord ? "true" : "false", e);
    return addRecord;
}

bool narrowFilePath(const wchar_t* directory, const wchar_t* name, char* out) {
    if (directory == nullptr || name == nullptr) return false;
    size_t used = wcstombs(out, directory, kNarrowFilePathBytes);
    if (used == static_cast<size_t>(-1) || used >= kNarrowFilePathBytes) return false;
    size_t more = wcstombs(out + used, name, kNarrowFilePathBytes - used);
    if (more == static_cast<size_t>(-1) || used + more >= kNarrowFilePathBytes) return false;
    out[used + more] = '\0';
    return true;
}

int statusErrorOf(const std::string& directory, const char* name) {
    std::string path = directory;
    if (path.empty() || path.back() != '/') path += '/';
    path += name;
    struct stat status;
    return Env::Current()->linkStatus(path.c_str(), &status) == 0 ? 0 : errno;
}

}  // namespace fscanner
