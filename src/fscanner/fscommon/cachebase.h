// The cache engine's base: the files it owns, its validity marks and its
// query memory.  A caller constructs FS_Cache or FS_Cache2, calls create,
// takes the lock, runs queries, unlocks and closes.
#ifndef FSCANNER_FSCOMMON_CACHEBASE_H
#define FSCANNER_FSCOMMON_CACHEBASE_H

#include <cstdio>
#include <ctime>
#include <map>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/querystats.h"

class AbstractMutex;
class FS_Table;
class RecordSet;
class Fields;
class Field;
class CriteriaEvaluator;
class FileHashBlackBox;
class FsQuery;
class FsResultSetWriter;
class QvLogWrapper;
class PathHelper;

// One entry of the path memo: a directory's own component (kelm_malloc
// block of 0x4004 bytes, owned) and its parent's id.
struct MapItem {
    wchar_t* text;
    unsigned int parentId;
};

// Options the creator hands the engine.  Only tail is set by the constructor.
struct FsGlue {
    FileHashBlackBox* knownHashes;   // not owned; wanted checksums or null
    unsigned int checksumFlags;      // any of 0xe0: scans compute checksums
    unsigned int reserved;           // copied, never read
    bool cacheRemoteDrives;          // remote roots go through the cache too
    unsigned int tail;               // 0, not read by the engine
    FsGlue() : tail(0) {}
};

// One root's exclude digest, keyed by root path in FS_CacheBase.
class ExcludeMD5 {
public:
    ExcludeMD5() { clear(); }
    // True if all 16 digest bytes equal *digest; valid is not looked at.
    bool compare(unsigned int (*digest)[4]) const;
    // Stores the digest and sets valid; name is ignored.
    void update(char const* name, unsigned int (*digest)[4]);
    void clear();

    std::string name;          // never filled
    unsigned int word;         // 0
    unsigned int digest[4];
    unsigned int valid;        // 0 or 1
};

// The provider-name mark kept in <cache directory>/pr_hash.
class ProviderHash {
public:
    explicit ProviderHash(wchar_t const* providerName);
    ~ProviderHash();
    ProviderHash(const ProviderHash&) = delete;
    ProviderHash& operator=(const ProviderHash&) = delete;

    // fileName = cachePath + "/pr_hash".  False on null or no memory.
    bool setCachePath(wchar_t const* cachePath);
    // Reads 16 bytes into digest; false with no fileName, no file or a short read.
    bool readMd5OfProvider();
    // The same; *exact then tells whether the file holds those 16 bytes and
    // nothing more, as writeMd5File leaves it.
    bool readMd5OfProvider(bool* exact);
    // Digests name like updateMd5OfProvider and compares with digest, unchanged.
    bool compareMd5OfProvider(wchar_t const* name);
    // Digests providerName into digest and writes the file.
    bool updateMd5OfProvider();
    // Writes the 16 bytes; false with no fileName, no open or a short write.
    bool writeMd5File();

    wchar_t* fileName;         // owned (kelm_malloc)
    wchar_t* providerName;     // owned (kelm_malloc)
    unsigned char digest[16];
};

enum {
    FS_CACHE_CREATE = 0,
    FS_CACHE_OPEN = 1,
    FS_CACHE_OPEN_ALWAYS = 2
};

enum {
    SUCCESS = 0,
    CACHE_UNUSABLE = -40,
    SCAN_TIMED_OUT = -41,
    BUILD_TIMED_OUT = -42,
    CACHE_ALREADY_OPENED = -51,
    CACHE_LOCK_TIMED_OUT = -52,
    CACHE_ERROR = -53
};

// A directory id at or above this (95% of the 32-bit range) refuses the cache.
const unsigned int DIRECTORIES_INDEX_LIMIT = 0xf3333334u;

class FS_CacheBase {
public:
    FS_CacheBase(wchar_t const* directoriesTable, wchar_t const* filesTable, wchar_t const* cachePath,
                 bool tableFlag, bool cacheChecker, FsGlue* glue, wchar_t const* providerName);
    // Not virtual: the class's table holds the two slots below and nothing
    // else.  It closes nothing; close() is the caller's duty.
    ~FS_CacheBase();
    FS_CacheBase(const FS_CacheBase&) = delete;
    FS_CacheBase& operator=(const FS_CacheBase&) = delete;

    // Virtual slots, in this order.
    virtual bool isFileToBeCached(FsQuery const& query, wchar_t const* name) = 0;
    virtual void saveOrRestoreFilesOrMasksForCaching(FsQuery const& query) = 0;

    // --- validity marks ---
    // MD5 text over the included paths, the first 9 bytes of the last path's
    // buffer after "**BREAK**" is appended to it, and the excluded paths.
    // Empty if an included path starts with $remote::, $all:: or $other::.
    void getMd5OfPaths(std::vector<PathInfo>& included, std::vector<PathInfo>& excluded,
                       std::string& result);
    bool compareMd5OfExclude(std::vector<PathInfo>& excludes, wchar_t const* root);
    void updateMd5OfExclude(std::vector<PathInfo>& excludes, wchar_t const* root);
    void readMd5OfExclude();
    void writeMd5File();
    void removeMd5FromExcludes();

    // --- query driver ---
    // The entry: -40 at once on an uninitialised, unopened or unusable cache;
    // a -40 or -42 from the flow latches cacheUnusable.  CACHE_ERROR (-53):
    // the disk refused a write to the cache (full, over quota, a table past
    // its 32-bit size).  The rows of the root being built are removed again,
    // the other roots stay and are served by later queries, nothing of this
    // query is served, the cache is not latched, and errno holds the
    // system's reason.
    int executeQueryEx(FsResultSetWriter& writer, FsQuery const& query, unsigned int timeout,
                       unsigned int maxCacheAge);
    int executeQueryCacheOnlyEx(FsResultSetWriter& writer, FsQuery const& query,
                                unsigned int timeout, unsigned int maxCacheAge);
    // What the last executeQueryEx of this object did: roots served, rebuilt
    // and walked, files and directories scanned, hits, the lookup, and the
    // entries its walks left out by cause.  Emptied when executeQueryEx
    // starts.  A query that repeats the paths of this object's last one
    // visits no root, and its root counts stay 0.  Entries left out when a
    // tree was built are told by the query that built it, not by the later
    // ones that are served from it.  The record belongs to the object and
    // lives as long as it; another thread may read its entriesScanned()
    // while a query runs.
    FsQueryStatistics const& lastQueryStatistics() const;

    // --- lifecycle ---
    // 0, CACHE_ALREADY_OPENED (-51) or CACHE_ERROR (-53); timeout is only traced.
    // After a CACHE_ERROR of a cache whose tables could not be made, errno
    // holds the system's reason (ENOSPC on a full disk, EACCES, ...).
    int create(unsigned int timeout, int creationDisposition);
    int lock();
    int lock(int timeout);
    void unlock();
    bool close();
    bool remove();
    bool compact();
    bool insideCacheUpdate();
    void beginCacheUpdate();
    void endCacheUpdate();
    bool getDirectoriesIDCounter();
    bool updateDirectoriesIDCounter();
    void removeDirectoriesIDCounter();
    void initObjects();
    void deleteObjects();
    bool createCache();
    bool openCache();
    void openTable(FS_Table** tableSlot, wchar_t const* name);
    void deleteTable(FS_Table* table);
    void removeCatSet();

    // --- tables (cachetables.cpp) ---
    // New table object with the directory (files) schema and hash indexes, on
    // new files.  On failure the slot is null and the object is gone.
    bool createDirectoriesTable(FS_Table** slot, wchar_t const* name);
    bool createFilesTable(FS_Table** slot, wchar_t const* name);
    // The shared lookup variables and the seven prepared criteria; false on
    // the first failure, with its trace.
    bool buildLookups();
    void deleteLookups();

    // True if the whole path exists; its last component's row is then
    // current in first.  Both cursors are repositioned.
    bool findPathByName(RecordSet& first, RecordSet& second, wchar_t* path, bool caseSensitive);
    // Full path of directory id into buffer (size in wide characters); false
    // on a broken chain, id 0 or a buffer too small.
    bool findPathById(RecordSet& directories, unsigned int id, wchar_t* buffer, unsigned int size);
    // The last walk of findPathByIdAlong, root first: the directory ids of
    // its path, where each one's component ends in text, and whether a
    // separator follows the component when a deeper one does.  The next
    // directory of an extraction mostly shares all but the last few
    // components: from the deepest id the two walks share, the path is the
    // text's up to there, as the memo would give it again component by
    // component.
    struct PathChain {
        struct Step {
            unsigned int id;
            size_t end;
            bool separatorAfter;
        };
        std::vector<Step> steps;
        std::wstring text;
        // The steps of the walk under way, leaf first, each end still where
        // it is in the buffer the walk builds in.
        std::vector<Step> fresh;
        size_t edits = 0;  // pathMemoEdits when the walk ended
        bool valid = false;
    };
    // findPathById, answering from chain (null: none) where the walk meets
    // it and keeping the walk there for the next call.  The memo is looked
    // at and filled exactly as findPathById does: the chain answers only
    // for ids the memo holds as they were, and goes whenever an entry of it
    // goes.
    bool findPathByIdAlong(RecordSet& directories, unsigned int id, wchar_t* buffer, unsigned int size,
                           PathChain* chain);
    // Removes every file row of directory pathId.
    void removeFiles(FS_Table* files, unsigned int pathId);
    // Removes the directory id, every row below it and their files.
    void removeTree(FS_Table* directories, FS_Table* files, unsigned int id);
    // Releases the texts of the path memo and empties it.
    void clearPathMemo();

    // --- cache scan (cache_scan.cpp) ---
    // Scans root into the tables; 0 done, 2 timed out.
    int build(FsQuery const& query, PathDrive& root, RecordSet& directories,
              unsigned int& directoriesIndex, RecordSet& files, RecordSet& directories2,
              std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
              int timeoutMs);
    // Walks path and writes its rows below parentId; 0, or 2 when the budget
    // ran out.  One DirectoryWalker (walk.h) reads the tree; this object's
    // sink writes the rows and counts.
    int scan(FsQuery const& query, PathDrive& path, RecordSet& directories,
             unsigned int& directoriesIndex, RecordSet& files, int parentId,
             std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
             int timeoutMs, int logDepth);

    // Test seam: when set, scan calls it with each directory's narrow path
    // right after reading the directory, before visiting its entries.
    static void (*scanHook)(char const* directory);

    // --- extraction (cache_extract.cpp) ---
    // Writes every row of files that passes query and lies in a directory the
    // paths ask for.  0, SCAN_TIMED_OUT when timeoutMs (counted from the call)
    // runs out, CACHE_UNUSABLE when a directory's path cannot be rebuilt.
    // Not reentrant: it uses two process-wide path buffers.
    int extractResults(FsResultSetWriter& writer, wchar_t const* query,
                       std::vector<DriveInfo>& drives, std::vector<PathDrive>& roots,
                       std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes,
                       RecordSet& files, RecordSet& directories, bool caseSensitive,
                       int timeoutMs);

    // New new[] string: directory, '/' unless it ends in one, name, suffix.
    static wchar_t* getCacheFileName(wchar_t const* directory, wchar_t const* name,
                                     wchar_t const* suffix);

    // Fields, in this order.
    AbstractMutex* accessMutex;
    FILE* folderLog;
    FS_Table* tbFiles;
    FS_Table* tbDirectories;
    RecordSet* filesCursor;
    RecordSet* directoriesCursor;
    RecordSet* directoriesCursor2;
    wchar_t* filesTableName;
    wchar_t* directoriesTableName;
    wchar_t* cachePathName;
    wchar_t* mutexName;
    unsigned int directoriesIndex;
    bool cacheInitialized;
    bool cacheOpened;
    bool cacheUnusable;
    bool tableFlag;
    bool cacheChecker;
    // Where the scan converts directory paths (grown, never shrunk; its size
    // decides which long multibyte paths still convert).
    char* narrowPathBuffer;
    size_t narrowPathBufferSize;
    // No longer used by the scan, which decodes names into its walker; kept
    // so that the object's layout stays as it was.
    wchar_t* wideNameBuffer;
    // Counts the entries dropped from pathMemo or replaced in it (in the
    // place of the buffer's size, which it no longer has): a walk kept from
    // before holds only while no entry it answered from has gone.
    size_t pathMemoEdits;
    // Directory id -> component and parent id, of the ids walked last.
    std::map<int, MapItem> pathMemo;
    Fields* defaultVariables;
    // id, pathid, parentid, pathname, shortpathname, filename, shortfilename,
    // md5, crc32, q32: handles into defaultVariables, not owned.
    Field* variableHandles[10];
    // critPathId, critParentId, critId, critPathOrShortPath, critPathName,
    // critFileOrShortFile, critFileName.
    CriteriaEvaluator* criteria[7];
    // Column and value of the one index lookup under way.
    ExpValue hashValue;
    std::map<std::string, ExcludeMD5> excludeMd5;
    wchar_t* exHashFileName;
    std::string lastMd5OfPaths;
    ProviderHash providerHash;
    // Query memory.
    bool firstQuery;
    bool pathsChanged;
    bool fileSystemsChanged;
    std::vector<PathInfo> prevIncludedPaths;
    std::vector<PathInfo> prevExcludedPaths;
    std::vector<FileSystemInfo> prevIncludedFileSystems;
    std::vector<FileSystemInfo> prevExcludedFileSystems;
    std::vector<DriveInfo> driveList;
    std::vector<DriveInfo> prunedDriveList;
    std::vector<PathInfo> drivePaths;
    std::vector<PathInfo> prunedDrivePaths;
    std::vector<PathInfo> droppedDrivePaths;
    std::vector<PathDrive> includeParentResolved;
    std::vector<PathDrive> includeResolved;
    std::vector<PathDrive> includeExcluded;
    std::vector<PathDrive> includeUnresolved;
    std::vector<PathDrive> includeRoots;
    std::vector<PathDrive> excludeParentResolved;
    std::vector<PathDrive> excludeResolved;
    std::vector<PathDrive> excludeExcluded;
    std::vector<PathDrive> excludeUnresolved;
    std::vector<PathInfo> localIncludePaths;
    std::vector<PathInfo> localExcludePaths;
    std::vector<PathInfo> remoteIncludePaths;
    std::vector<PathInfo> remoteExcludePaths;
    std::vector<PathInfo> scanExcludePaths;
    std::vector<PathInfo> scanIncludePaths;
    char const* className;
    QvLogWrapper* log;
    FileHashBlackBox* knownHashes;
    unsigned int checksumFlags;
    unsigned int reserved;
    bool cacheRemoteDrives;
    bool computeChecksums;
    int filesScanned;
    int directoriesScanned;
    wchar_t* catSetFileName;

private:
    // The record behind lastQueryStatistics, made on first use; the walks
    // of the query write to it.  forgetQueryStatistics drops it (destructor).
    FsQueryStatistics& queryStatistics() const;
    void forgetQueryStatistics();
    // Traces why the cache directory cannot hold a cache (missing, not a
    // directory, not writable, or, by errno, on a full file system), naming
    // it; nothing when it looks usable.
    void traceCacheDirectoryProblem();
    // Points set at the rows whose column equals a value, through the hash
    // index: the column and value go into hashValue, the value into the
    // variable, then the criterion is set on the cursor.  text null: the
    // value is number.  True when a first row is current.
    bool lookUp(RecordSet& set, int criterion, wchar_t const* column, int variable,
                unsigned int number, wchar_t const* text, bool caseSensitive);
    // Decides one local root of a query and rebuilds it when the cache may
    // not serve it: -1 served from the cache, 0 built, 2 build timed out,
    // 3 a table refused a write (the build's rows are removed again and
    // errno is its reason), 1 build failed otherwise.  cacheValid carries
    // over to the next root.
    int visitLocalRoot(FsQuery const& query, PathDrive& root, PathHelper& pathHelper,
                       bool caseFlag, unsigned int timeout, unsigned int maxCacheAge,
                       time_t now, bool& cacheValid);
    // The end of every query: extraction with the lists of the resolution
    // that last ran.
    int extractFromCache(FsResultSetWriter& writer, FsQuery const& query, PathHelper& pathHelper,
                         bool caseFlag, unsigned int timeout);
    // Removes every directory row with an id above lastKeptId and every file
    // row of those directories: all that a build which began at that id
    // wrote, reachable from its root or not.  Needs no disk space.
    void removeRowsAbove(unsigned int lastKeptId);
    bool createTables();
    // Opens the files cursor and both directories cursors on the open tables;
    // dropCursors forgets the handles (the tables own the cursors).
    void openCursors();
    void dropCursors();
    void exclusionDigest(std::vector<PathInfo>& excludes, bool throttle, unsigned int (*digest)[4]);
    static std::string exclusionKey(wchar_t const* root);
};

#endif
