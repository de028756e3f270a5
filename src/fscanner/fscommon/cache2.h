// The two concrete caches: which files are worth keeping.
#ifndef FSCANNER_FSCOMMON_CACHE2_H
#define FSCANNER_FSCOMMON_CACHE2_H

#include "fscanner/fscommon/cachebase.h"

// Caches every file.
class FS_Cache : public FS_CacheBase {
public:
    FS_Cache(wchar_t const* directoriesTable, wchar_t const* filesTable, wchar_t const* cachePath,
             bool tableFlag, bool cacheChecker, FsGlue* glue, wchar_t const* providerName);
    bool isFileToBeCached(FsQuery const& query, wchar_t const* name) override;
    void saveOrRestoreFilesOrMasksForCaching(FsQuery const& query) override;
};

// Caches only files the query names for caching, and keeps that selection in
// <cache directory>/cat_set: records back to back, no header, each a 32-bit
// host-order count of wide characters followed by that many 32-bit wide
// characters, no terminator; exact names in set order, then masks in order.
class FS_Cache2 : public FS_CacheBase {
public:
    FS_Cache2(wchar_t const* directoriesTable, wchar_t const* filesTable, wchar_t const* cachePath,
              bool tableFlag, bool cacheChecker, FsGlue* glue, wchar_t const* providerName);
    bool isFileToBeCached(FsQuery const& query, wchar_t const* name) override;
    // Empty caching set: restore it from cat_set into the query (the object
    // behind the reference is modified).  Otherwise: save it to cat_set.
    void saveOrRestoreFilesOrMasksForCaching(FsQuery const& query) override;
};

#endif
