// The direct walk: answers a query by reading a directory tree on the file
// system itself, without the cache, and writes one record per file that the
// criteria stage accepts.
//
// Threads: the walk keeps process-wide buffers and the list of the
// distributed file system's local names in unguarded statics, so only one
// walk may run in a process at a time.
#ifndef FSCANNER_FSCOMMON_FSBUILD_H
#define FSCANNER_FSCOMMON_FSBUILD_H

#include <dirent.h>

#include <cstring>
#include <cwchar>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/querystats.h"
#include "fscanner/fscommon/strlist.h"

struct FileChecksumInfo;
class CriteriaEvaluator;
class FileHashBlackBox;
class fpPathCommand;
class fpTypeCommand;

// Hooks for a distributed file system's own library.  On this platform there
// is none: every hook does nothing and returns 0 (null), so a "dfs" tree is
// treated as local.  A back end can be plugged in process-wide (tests do);
// the helper itself holds no state.
class FileSystemHelper {
public:
    // What a distributed file system's library would provide.  Strings it
    // returns stay owned by the back end.
    class Backend {
    public:
        virtual ~Backend() {}
        virtual char* dfs_mount(const char* path) = 0;
        virtual char* dfs_hname() = 0;
        virtual int load_dfs_local(char* host, StringList<char>& list) = 0;
        virtual int dfs_local(const char* fileSet, const char* host) = 0;
    };
    // Not owned; null restores the empty hooks.  Process-wide, unguarded.
    static void setBackend(Backend* backend);

    FileSystemHelper() {}
    ~FileSystemHelper() {}
    // The file set that holds path; null when none.
    char* dfs_mount(const char* path);
    // This host's name for the distributed file system; null when none.
    char* dfs_hname();
    // Fills list with the local file sets of host; 0 when loaded.
    int load_dfs_local(char* host, StringList<char>& list);
    // Nonzero when fileSet is local to host.
    int dfs_local(const char* fileSet, const char* host);
};

// The criteria stage of the walk: decides for each file whether it is a hit.
//
// A processor binds the query's expression to the attributes of one file at a
// time, through these columns of its own Fields, in this order:
//   FILENAME      text    the file's name
//   SHORTFILENAME text    the short name, stored only when one is given
//   SIZE          64-bit  the file's size
//   ATTR          32-bit  the attribute bits
//   PATHID        32-bit  never stored: reads 0
//   MD5           text    always "0"
//   CRC32         32-bit  always 0
//   Q32           32-bit  always 0
// The checksum columns are fixed whatever the walk computed: sums never reach
// the expression; they act only through the known-checksum set.  The language
// gains two commands while this processor's evaluator is the newest in the
// process: path(number, text), the full path of the current file (arguments
// not read), and type(text, text), 1 when the file named by the first
// argument is of a kind the second names, as the system's `file` command words
// it.
//
// processingFlags asks the walk for checksums: 0x20 MD5, 0x40 CRC32, 0x80 Q32;
// the five low bits are carried and never read by the walk.
//
// Ownership: the processor owns its evaluator and both commands; the
// known-checksum set belongs to the caller and must outlive the processor.
// Not copyable.  One thread at a time (the command table is process-wide).
class FileProcessor {
public:
    static const unsigned int PROCESS_MD5 = 0x20;
    static const unsigned int PROCESS_CRC32 = 0x40;
    static const unsigned int PROCESS_Q32 = 0x80;
    // What the two-argument constructor asks for: no checksum at all.
    static constexpr unsigned int PROCESS_DEFAULT = 0x1f;

    // criteria may be null: the processor then answers false for every file.
    // No known-checksum set.
    FileProcessor(const wchar_t* criteria, bool caseSensitive);
    // hashes is not owned and may be null.
    FileProcessor(const wchar_t* criteria, bool caseSensitive, unsigned int flags,
                  FileHashBlackBox* hashes);
    ~FileProcessor();

    // True when the expression evaluates to exactly 1 for info (and, with a
    // known-checksum set, when that set holds one of the sums the checksum
    // flags mark).  shortName may be null (the walk always passes null); a
    // null one leaves SHORTFILENAME as the previous file left it.
    bool satisfyCriteria(const FsFileInfo& info, const FileChecksumInfo& checksums,
                         const wchar_t* shortName);

    // Test seam: when set, called with every file the walk offers, before the
    // answer is made.  Process-wide, unguarded; null (the default) turns it off.
    typedef void (*CriteriaObserver)(const FsFileInfo& info, const FileChecksumInfo& checksums,
                                     const wchar_t* shortName);
    static void setCriteriaObserver(CriteriaObserver observer);

    // The members stand in one access section so that their order in memory
    // is their order here.
    bool caseSensitive;
    Fields fields;                 // the columns above
    CriteriaEvaluator* evaluator;  // owned; invalid for a null expression
    fpTypeCommand* typeCommand;    // owned
    fpPathCommand* pathCommand;    // owned
    unsigned int processingFlags;  // read by the walk
    FileHashBlackBox* hashes;      // not owned; null for none

private:
    FileProcessor(const FileProcessor&);
    FileProcessor& operator=(const FileProcessor&);

    void initialize(const wchar_t* criteria);
};

// Results of the walks.
const int FS_SCAN_DONE = 0;
const int FS_SCAN_TIMED_OUT = 2;

// The entry point.  Refuses (result 0, trace only) a root that is excluded by
// a recursive match, that is not a directory, or that is a symbolic link;
// otherwise the result of fs_scan.
int fs_build(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& root,
             std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
             int timeoutMs);

// Visits one directory and recurses.  0 when finished or this directory was
// given up (too long, unreadable); 2 when the time budget ran out, in which
// case every level stops at once.  Records written so far stay written.
int fs_scan(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& path,
            std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
            int timeoutMs);

// The same two walks, telling statistics (not owned; null for none) what
// they did: files offered to the processor, directories entered below the
// root, records written, and every entry left out by cause (an unreadable
// directory, a name the locale cannot convert, a path past 4095 characters).
// The counts add to what the record holds; roots and the lookup are the
// caller's to fill.  Results and traces are those of the forms above.
int fs_build(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& root,
             std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
             int timeoutMs, FsQueryStatistics* statistics);
int fs_scan(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& path,
            std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
            int timeoutMs, FsQueryStatistics* statistics);

// True only for an existing real directory (lstat: a link to one is false).
bool fs_isValidPath(wchar_t* path);

// Reads a directory whole, in readdir order, nothing filtered.  Returns the
// number of entries, or -1 (open or close failure, allocation failure, no
// entry at all).  Each entry is a kelm_malloc copy of d_reclen bytes; the
// caller releases each entry and the array with kelm_free.  On an allocation
// failure the entries kept so far stay allocated and *namelist holds them.
//
// The entries have the layout of `dirent` with large-file support, which the
// library is built with: on 32-bit targets a caller must compile with
// _FILE_OFFSET_BITS=64 (the CMake package and pkg-config file carry it), or
// its `dirent` has other offsets than the entries it is given.  Such a caller
// gets a compile error at its call instead of misread entries.
#if defined(__SIZEOF_POINTER__) && __SIZEOF_POINTER__ == 4 && \
    (!defined(_FILE_OFFSET_BITS) || _FILE_OFFSET_BITS != 64)
int scandir(const char* path, dirent*** namelist)
    __attribute__((error("scandir(path, namelist) needs _FILE_OFFSET_BITS=64 on this target")));
#else
int scandir(const char* path, dirent*** namelist);
#endif

// scandir that also says why a directory could not be read: *error (may be
// null) is 0, or the errno of the failed open, of a read that broke off part
// way, or of the close.  A read that broke off keeps what it read and
// returns it as scandir does; every other result is scandir's.  The walks
// read their directories through it.  The entries have the layout above.
#if defined(__SIZEOF_POINTER__) && __SIZEOF_POINTER__ == 4 && \
    (!defined(_FILE_OFFSET_BITS) || _FILE_OFFSET_BITS != 64)
int fs_readDirectory(const char* path, dirent*** namelist, int* error)
    __attribute__((error("fs_readDirectory needs _FILE_OFFSET_BITS=64 on this target")));
#else
int fs_readDirectory(const char* path, dirent*** namelist, int* error);
#endif

#endif
