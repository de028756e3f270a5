// The one directory walk of the library.  The cache build and the direct
// scan both visit a tree with it; what each does with an entry (write a row,
// offer a file to the criteria stage, trace, count) lives in a sink.
//
// One directory, in this order:
//   1. the budget: below 1 ms left, skipDirectory(TimedOut) and result 2;
//   2. the path: past 4095 characters, or without a multibyte form in the
//      caller's conversion buffer, skipDirectory and result 0;
//   3. enterDirectory; the directory is read whole through a descriptor;
//      directoryListed; every entry that will be visited gets its status by
//      fstatat on that descriptor (never following a link); the descriptor
//      is closed before the first entry is visited, so none stays open
//      during the recursion.  An unreadable directory: skipDirectory
//      (Unreadable), leaveDirectory, result 0;
//   4. the entries from the last read to the first: skipEntry for those
//      passed over before their status (why: Undecodable, and with the
//      options below Dot, PathTooLong, Excluded), visitEntry for the rest,
//      which may ask to descend; a child's result other than 0 ends the
//      directory at once and goes up;
//   5. leaveDirectory.
//
// Status: a visited entry's FsFileInfo holds the path with its separator and
// the name, and the status its full path would give to lstat.  The walker
// takes it from fstatat; where fstatat fails, or the full narrow path would
// be past the system's 4095 bytes, it asks FsFileInfo::updateInfo, which
// makes the full-path call with its trace, so a failure looks exactly as it
// always did.  "." and ".." of a directory that answered a status call for
// another entry, or that we own with search permission, are directories
// without a call of their own.
//
// Threads: a walker and its sink belong to one thread; the caller's
// conversion buffer and the local-list state of the distributed file system
// are shared by every walk of their owner, unguarded.
#ifndef FSCANNER_FSCOMMON_WALK_H
#define FSCANNER_FSCOMMON_WALK_H

#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/fsbuild.h"

class QvLogWrapper;
struct FileChecksumInfo;

namespace fscanner {

// Why the walker passes over a directory or an entry.
enum class WalkSkip {
    TimedOut,          // directory: the budget was spent on entering
    PathTooLong,       // directory: over 4095 characters;
                       // entry: directory and name over 4095 characters
    NotConvertible,    // directory: no multibyte form in this locale
    ConvertedTooLong,  // directory: its multibyte form does not fit the
                       // conversion buffer
    OutOfMemory,       // directory: the conversion buffer could not grow
    Unreadable,        // directory: open, read or close failed, or no entry
    Undecodable,       // entry: the name has no wide form in this locale
    Dot,               // entry: "." or ".."
    Excluded,          // entry: a recursive exclude matches its full path
};

// One directory of the walk, as the sink sees it.  Valid from
// enterDirectory to leaveDirectory; the strings are the walker's.
struct WalkDirectory {
    PathDrive* path;                // as given: drive, file system, recursive flag
    const wchar_t* pathName;        // the path as given
    size_t pathLength;              // in characters
    const std::string* narrowPath;  // its multibyte form (after step 2)
    size_t prefixLength;            // characters of the path with one
                                    // separator at its end
    int depth;                      // 0 for the walk's start
    int64_t tag;                    // the caller's value for it (a row id)
    bool listed;                    // read (perhaps in part); false when unreadable
    int readError;                  // errno of a failed or broken-off read, else 0
};

// One entry of a directory.  Valid for the one call that gets it.
struct WalkEntry {
    const char* name;          // as read
    size_t nameBytes;
    const wchar_t* wideName;   // decoded; null for an undecodable name
    size_t nameLength;         // in characters
    const wchar_t* fullPath;   // prefix + name; null past 4095 characters
    bool dot;                  // "." or ".."
};

// What a sink answers for a visited entry.
struct WalkVisit {
    bool descend = false;      // walk fullPath as a child directory ...
    int64_t childTag = 0;      // ... with this tag
};

class WalkSink {
public:
    virtual ~WalkSink() {}
    // Step 1 or 2 stopped the directory; no enter or leave follows.  Also
    // step 3's Unreadable, between enter and leave.  error: errno or 0.
    virtual void skipDirectory(const WalkDirectory& directory, WalkSkip why, int error) = 0;
    // Before the directory is read; narrowPath is set.
    virtual void enterDirectory(const WalkDirectory& directory) = 0;
    // The directory was read (readError tells a read that broke off).
    virtual void directoryListed(const WalkDirectory& directory) = 0;
    virtual void skipEntry(const WalkDirectory& directory, const WalkEntry& entry, WalkSkip why) = 0;
    // info holds path, name and status; known is false when the status call
    // failed (attr then reads 0 and the entry is a file).
    virtual WalkVisit visitEntry(const WalkDirectory& directory, const WalkEntry& entry,
                                 FsFileInfo& info, bool known) = 0;
    // After every enterDirectory; result is what the directory gives up.
    virtual void leaveDirectory(const WalkDirectory& directory, int result) = 0;
};

// Where the walker converts a directory's path to its multibyte form: a
// kelm_malloc block of 3 bytes per character plus 1, grown, never shrunk,
// and kept by its owner across walks.  Its size decides whether a path whose
// multibyte form is longer still converts, so each owner keeps its own.
struct WalkConversionBuffer {
    char** block;
    size_t* size;
};

struct WalkOptions {
    WalkConversionBuffer conversion{nullptr, nullptr};
    // Before its status: pass over "." and ".." (skipEntry Dot) ...
    bool dotsBeforeStatus = false;
    // ... entries whose directory and name pass 4095 characters ...
    bool lengthBeforeStatus = false;
    // ... and entries that a recursive entry of this list matches (null:
    // none).  Otherwise every decodable entry is visited with its status.
    const std::vector<PathInfo>* entryExcludes = nullptr;
    bool caseSensitive = false;
};

class DirectoryWalker {
public:
    static const size_t kMaxPath = 4095;  // characters of a path, and bytes

    DirectoryWalker(WalkSink& sink, const WalkOptions& options);
    ~DirectoryWalker();
    DirectoryWalker(const DirectoryWalker&) = delete;
    DirectoryWalker& operator=(const DirectoryWalker&) = delete;

    // Walks path and what its sink asks to descend into: 0, or 2 when the
    // budget ran out.
    int walk(PathDrive& path, int timeoutMs, int64_t tag);

private:
    struct Level;
    // ownStatus: the directory's status as its parent's pass took it, or null.
    int walkDirectory(PathDrive& path, int timeoutMs, int64_t tag, int depth, const struct stat* ownStatus);
    // Reads the open directory fd into level; -1 (with *error) as scandir.
    int readEntries(int fd, Level& level, int* error);
    void statusPass(int fd, Level& level, const WalkDirectory& directory, const struct stat* ownStatus);

    WalkSink& sink_;
    WalkOptions options_;
    std::vector<Level*> levels_;  // one per depth, reused by every directory there
    std::vector<char> readBuffer_;
    uid_t userId_;  // whose permissions the status calls are made with
};

// The process-wide local list of a distributed file system, loaded at most
// once per owner.
struct DfsLocalList {
    StringList<char>* names = nullptr;
    bool loaded = false;
    bool pending = true;  // not tried yet
};

// How one walk words the traces of the decision below: each message is
// prefix + text + end; the two about loading the list use loadPrefix.
struct DfsTraceStyle {
    const char* prefix;
    const char* loadPrefix;
    const char* end;
    const char* function;
};

// Decides, for one directory of a "dfs" tree, whether its files are
// recorded: local trees on a local drive, remote ones on a remote drive.
// Traces at traceMAX.
bool dfsDecision(QvLogWrapper* log, const DfsTraceStyle& style, DfsLocalList& list, const char* narrowPath,
                 DriveType driveType);

// The multibyte directory + name within 4096 bytes, for the checksum pass;
// false when either part does not convert or the whole does not fit.
bool narrowFilePath(const wchar_t* directory, const wchar_t* name, char* out);
const size_t kNarrowFilePathBytes = 4096;

// Why the status of directory/name cannot be read, for the statistics: the
// call is made again on the full path, as the first one's errno is gone.
// 0 when it now succeeds.
int statusErrorOf(const std::string& directory, const char* name);

}  // namespace fscanner

#endif
