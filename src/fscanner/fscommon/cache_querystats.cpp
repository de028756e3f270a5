// The query statistics record of each cache object.  The record itself
// (querystats.cpp) knows nothing of caches; the cache keeps its records here.
#include <map>
#include <memory>
#include <mutex>

#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/querystats.h"

// ------------------------------------------ the record of a cache object
//
// The cache classes have a fixed field layout that hosts compile against, and
// no field of it can hold a pointer to one more object.  The record therefore
// lives in a table of the process keyed by the object's address: made on
// first use, removed by the object's destructor.  A later object at the same
// address starts with a new record.

namespace {

std::mutex recordsLock;

// Never destroyed: a cache object of static storage may be destroyed after
// the table would have been.
std::map<const FS_CacheBase*, std::unique_ptr<FsQueryStatistics>>& records()
{
    static auto* table = new std::map<const FS_CacheBase*, std::unique_ptr<FsQueryStatistics>>();
    return *table;
}

}  // namespace

FsQueryStatistics& FS_CacheBase::queryStatistics() const
{
    std::lock_guard<std::mutex> guard(recordsLock);
    std::unique_ptr<FsQueryStatistics>& slot = records()[this];
    if (!slot)
        slot.reset(new FsQueryStatistics());
    return *slot;
}

FsQueryStatistics const& FS_CacheBase::lastQueryStatistics() const
{
    return queryStatistics();
}

void FS_CacheBase::forgetQueryStatistics()
{
    std::lock_guard<std::mutex> guard(recordsLock);
    records().erase(this);
}
