// The query a caller hands to the engine: paths and file systems to include
// and exclude, the expression text, the case mode, the CPU threshold and two
// pairs of exact names and name masks (one for caching, one for the query).
//
// The caller builds the query and passes it as const to the engine.  The
// object has no lock.  The virtual operations are an ABI: keep their order.
#ifndef FSCANNER_FS_FS_QUERY_H
#define FSCANNER_FS_FS_QUERY_H

#include <set>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"

class QvLogWrapper;
struct FsQueryData;

class FsQuery {
public:
    FsQuery();

    // 1, 2: append a PathInfo; 1 on success, 0 for a null path.
    virtual int addIncludePath(const wchar_t* path, bool recursive);
    virtual int addExcludePath(const wchar_t* path, bool recursive);
    // 3, 4: append a FileSystemInfo; 1, or 0 for null.
    virtual int addIncludeFileSystem(const wchar_t* fileSystem);
    virtual int addExcludeFileSystem(const wchar_t* fileSystem);
    // 5: appends to the process-wide MountTableManager::remoteFileSystems;
    // does not touch this query.  Returns 1 (0 for null).
    virtual int addRemoteFileSystem(const char* fileSystem);
    // 6: replaces the expression text; 1, or 0 for null / failed allocation
    // (the old text then stays).
    virtual int setQuery(const wchar_t* query);
    // 7: stores the mode (1 insensitive, 0 and 2 sensitive) if below 3;
    // other values are ignored.
    virtual void setCaseSensitive(unsigned int mode);
    // 8-11: the lists themselves (the engine passes them on by reference).
    virtual std::vector<PathInfo>& getIncludedPaths() const;
    virtual std::vector<PathInfo>& getExcludedPaths() const;
    virtual std::vector<FileSystemInfo>& getIncludedFileSystems() const;
    virtual std::vector<FileSystemInfo>& getExcludedFileSystems() const;
    // 12: the expression text, possibly null.
    virtual const wchar_t* getQuery() const;
    // 13: false only when the mode is 1.
    virtual bool getCaseSensitive() const;
    // 14-17: destroy the elements; return 1.
    virtual int clearIncludePaths();
    virtual int clearExcludePaths();
    virtual int clearIncludeFileSystems();
    virtual int clearExcludeFileSystems();
    // 18: empties the process-wide remote file system list; returns 1.
    virtual int clearRemoteFileSystems();
    // 19, 20
    virtual void setAssumeAutoFSDriveType(DriveType type);
    virtual DriveType getAssumeAutoFSDriveType() const;
    // 21: stores a copy (null for null).  The previous copy is not released.
    virtual void setCpuThreshold(const char* threshold);
    // 22: possibly null.
    virtual const char* getCpuThreshold() const;
    // 23-26
    virtual void setFirstTimeOnly(bool value);
    virtual bool getFirstTimeOnly() const;
    virtual void setFileSystemScan(bool value);
    virtual bool isFileSystemScan() const;
    // 27, 28: a name with "*" or "?" goes to the masks, any other to the
    // names.  Lowered first when the mode in force is case-insensitive.
    virtual void addFileOrMaskForCaching(const wchar_t* nameOrMask);
    virtual void addFileOrMaskForCaching(std::wstring nameOrMask);
    // 29
    virtual bool fileShouldBeCached(const wchar_t* name) const;
    // 30, 31
    virtual void addFileOrMaskForQuery(const wchar_t* nameOrMask);
    virtual void addFileOrMaskForQuery(std::wstring nameOrMask);
    // 32, 33: copies.
    virtual std::vector<std::wstring> getMasksForQuery() const;
    virtual std::set<std::wstring> getFilesForQuery() const;
    // 34
    virtual bool fileMatchesQuery(const wchar_t* name) const;
    // 35: exact names plus masks of the caching pair.
    virtual unsigned int getFileOrMaskForCachingSetSize() const;
    // 36, 37
    virtual std::set<std::wstring>& getFilesForCaching();
    virtual std::vector<std::wstring>& getMasksForCaching();
    // 38: writes the query, the mode, the drive type and the path and file
    // system lists to the wide standard output.
    virtual void dump();
    // 39: releases the texts with kelm_free, then the data.
    virtual ~FsQuery();

    // Places a name in the mask vector or the name set (see the virtual
    // operations 27 to 31).  Instantiated for std::string and std::wstring.
    template <typename CharType, typename StringType>
    void addNameOrNameMaskToRightContainer(StringType nameOrMask, std::vector<StringType>& masks,
                                           std::set<StringType>& names) const;
    template <typename CharType, typename StringType>
    void addNameOrNameMaskToRightContainer(const CharType* nameOrMask, std::vector<StringType>& masks,
                                           std::set<StringType>& names) const;
    // Exact name first, then the masks in insertion order.
    template <typename CharType, typename StringType>
    bool nameFoundOrMatchedAMask(StringType name, const std::vector<StringType>& masks,
                                 const std::set<StringType>& names) const;

private:
    FsQuery(const FsQuery&);
    FsQuery& operator=(const FsQuery&);

    FsQueryData* data;
    QvLogWrapper* log;
};

// The private data of a query, fields in ABI order.
struct FsQueryData {
    wchar_t* query;                 // kelm_malloc
    unsigned int caseSensitive;     // 1 insensitive, 0 and 2 sensitive
    std::vector<PathInfo> includedPathList;
    std::vector<PathInfo> excludedPathList;
    std::vector<FileSystemInfo> excludedFileSystemList;
    std::vector<FileSystemInfo> includedFileSystemList;
    DriveType assumeAutoFSDriveType;
    char* cpuThreshold;             // i_strdup, released with kelm_free
    bool firstTimeOnly;
    bool fileSystemScan;
    std::set<std::wstring> filesForCaching;
    std::vector<std::wstring> masksForCaching;
    std::set<std::wstring> filesForQuery;
    std::vector<std::wstring> masksForQuery;

    FsQueryData();
};

#endif
