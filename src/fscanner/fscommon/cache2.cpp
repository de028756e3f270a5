#include "fscanner/fscommon/cache2.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <vector>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache_files.h"
#include "fscanner/fscommon/trace.h"

namespace {

const size_t CAT_SET_NAME_LIMIT = 4096;

std::string catSetPath(wchar_t const* name)
{
    char buffer[CAT_SET_NAME_LIMIT + 1];
    memset(buffer, 0, sizeof(buffer));
    if (name != nullptr && wcstombs(buffer, name, CAT_SET_NAME_LIMIT) == static_cast<size_t>(-1))
        buffer[0] = '\0';
    buffer[CAT_SET_NAME_LIMIT] = '\0';
    return buffer;
}

}  // namespace

FS_Cache::FS_Cache(wchar_t const* directoriesTable, wchar_t const* filesTable,
                   wchar_t const* cachePath, bool tableFlag, bool cacheChecker, FsGlue* glue,
                   wchar_t const* providerName)
    : FS_CacheBase(directoriesTable, filesTable, cachePath, tableFlag, cacheChecker, glue,
                   providerName)
{
    className = "FS_Cache";
}

bool FS_Cache::isFileToBeCached(FsQuery const&, wchar_t const*)
{
    return true;
}

void FS_Cache::saveOrRestoreFilesOrMasksForCaching(FsQuery const&) {}

FS_Cache2::FS_Cache2(wchar_t const* directoriesTable, wchar_t const* filesTable,
                     wchar_t const* cachePath, bool tableFlag, bool cacheChecker, FsGlue* glue,
                     wchar_t const* providerName)
    : FS_CacheBase(directoriesTable, filesTable, cachePath, tableFlag, cacheChecker, glue,
                   providerName)
{
    className = "FS_Cache2";
}

bool FS_Cache2::isFileToBeCached(FsQuery const& query, wchar_t const* name)
{
    return query.fileShouldBeCached(name);
}

void FS_Cache2::saveOrRestoreFilesOrMasksForCaching(FsQuery const& constQuery)
{
    // The slot takes the query by const reference, yet restoring fills the
    // caller's caching set: the object itself is the caller's and mutable.
    FsQuery& query = const_cast<FsQuery&>(constQuery);
    std::string path = catSetPath(catSetFileName);
    if (query.getFileOrMaskForCachingSetSize() == 0) {
        FS_TRACE(log, MIN, "reloading catalog set from cache.");
        if (catSetFileName == nullptr)
            return;
        std::vector<std::wstring> records;
        cachefiles::ReadEnd end;
        uint32_t damagedCount = 0;
        if (!cachefiles::readCatalogSet(path.c_str(), &records, &end, &damagedCount))
            return;  // no saved set is no error
        // Each record is sorted into a name or a mask again; the records
        // before a damaged or cut one are kept.
        for (size_t i = 0; i < records.size(); ++i)
            query.addFileOrMaskForCaching(records[i].c_str());
        if (end == cachefiles::DAMAGED_RECORD)
            FS_TRACE(log, MIN, "damaged record of %u characters, reading stopped",
                               static_cast<unsigned int>(damagedCount));
        return;
    }
    FS_TRACE(log, MAX, "dumping catalog set to cache.");
    if (catSetFileName == nullptr)
        return;
    // Exact names in set order, then masks in vector order.
    std::vector<std::wstring> records;
    std::set<std::wstring>& names = query.getFilesForCaching();
    records.insert(records.end(), names.begin(), names.end());
    std::vector<std::wstring>& masks = query.getMasksForCaching();
    records.insert(records.end(), masks.begin(), masks.end());
    bool opened = false;
    if (!cachefiles::writeCatalogSet(path.c_str(), records, &opened)) {
        if (!opened)
            return;
        int reason = errno;
        // A set cut short by a full disk would be restored as a smaller set
        // and quietly narrow what later builds keep.  No saved set is the
        // state a reader knows how to take.
        cachefiles::removeSideFile(path.c_str());
        FS_TRACE(log, MIN, "cannot write '%s': %s; it is removed", path.c_str(), strerror(reason));
    }
}
