#include "fscanner/fscommon/querystats.h"

#include <climits>
#include <cstdlib>
#include <cstring>
#include <cwchar>

#include "base/QvLogWrapper.h"

// ------------------------------------------------------------ the record

const int FsQueryStatistics::SKIP_CAUSES;
const size_t FsQueryStatistics::KEPT_PATHS;

FsQueryStatistics::FsQueryStatistics()
    : rootsFromCache(0), rootsRebuilt(0), rootsWalked(0), filesScanned(0), directoriesScanned(0),
      hits(0), lookup(LOOKUP_NONE), progress(0)
{
}

FsQueryStatistics::FsQueryStatistics(const FsQueryStatistics& other)
    : rootsFromCache(other.rootsFromCache), rootsRebuilt(other.rootsRebuilt),
      rootsWalked(other.rootsWalked), filesScanned(other.filesScanned),
      directoriesScanned(other.directoriesScanned), hits(other.hits), lookup(other.lookup),
      indexColumn(other.indexColumn), progress(other.entriesScanned())
{
    for (int i = 0; i < SKIP_CAUSES; ++i)
        skipped[i] = other.skipped[i];
}

FsQueryStatistics& FsQueryStatistics::operator=(const FsQueryStatistics& other)
{
    if (this == &other)
        return *this;
    rootsFromCache = other.rootsFromCache;
    rootsRebuilt = other.rootsRebuilt;
    rootsWalked = other.rootsWalked;
    filesScanned = other.filesScanned;
    directoriesScanned = other.directoriesScanned;
    hits = other.hits;
    lookup = other.lookup;
    indexColumn = other.indexColumn;
    for (int i = 0; i < SKIP_CAUSES; ++i)
        skipped[i] = other.skipped[i];
    progress.store(other.entriesScanned(), std::memory_order_relaxed);
    return *this;
}

void FsQueryStatistics::reset()
{
    rootsFromCache = rootsRebuilt = rootsWalked = 0;
    filesScanned = directoriesScanned = hits = 0;
    lookup = LOOKUP_NONE;
    indexColumn.clear();
    for (int i = 0; i < SKIP_CAUSES; ++i)
        skipped[i] = SkippedEntries();
    progress.store(0, std::memory_order_relaxed);
}

long long FsQueryStatistics::skippedTotal() const
{
    long long total = 0;
    for (int i = 0; i < SKIP_CAUSES; ++i)
        total += skipped[i].count;
    return total;
}

void FsQueryStatistics::addSkipped(SkipCause cause, const char* directory, const char* name,
                                   int error)
{
    if (cause < 0 || cause >= SKIP_CAUSES)
        return;
    SkippedEntries& entries = skipped[cause];
    ++entries.count;
    if (entries.paths.size() >= KEPT_PATHS)
        return;
    std::string path = directory != nullptr ? directory : "";
    if (name != nullptr && name[0] != '\0') {
        if (!path.empty() && path.back() != '/')
            path += '/';
        path += name;
    }
    entries.paths.push_back(path);
    entries.errors.push_back(error);
}

void FsQueryStatistics::addSkipped(SkipCause cause, const wchar_t* path, int error)
{
    if (cause < 0 || cause >= SKIP_CAUSES)
        return;
    if (skipped[cause].paths.size() >= KEPT_PATHS || path == nullptr) {
        addSkipped(cause, static_cast<const char*>(nullptr), nullptr, error);
        return;
    }
    // A path this long is rare: the conversion may take what it needs.
    size_t room = wcslen(path) * MB_LEN_MAX + 1;
    std::string narrow(room, '\0');
    size_t used = wcstombs(&narrow[0], path, room);
    if (used == static_cast<size_t>(-1))
        narrow = QvLogWrapper::format("%ls", path);
    else
        narrow.resize(used);
    addSkipped(cause, narrow.c_str(), nullptr, error);
}
