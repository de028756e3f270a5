#include "fscanner/fscommon/cache2.h"

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include <unistd.h>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_query.h"

namespace {

const size_t CAT_SET_BUFFER_BYTES = 0x4000;  // 16 KiB: at most 4,095 characters a record
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

// True when the whole record went to the stream.
bool writeRecord(FILE* f, std::wstring const& text)
{
    uint32_t count = static_cast<uint32_t>(text.size());
    return fwrite(&count, 1, sizeof(count), f) == sizeof(count) &&
           fwrite(text.data(), sizeof(wchar_t), text.size(), f) == text.size();
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
        log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - reloading catalog set from cache.",
                      className, __func__);
        if (catSetFileName == nullptr)
            return;
        FILE* f = fopen(path.c_str(), "rb");
        if (f == nullptr)
            return;  // no saved set is no error
        wchar_t* buffer = static_cast<wchar_t*>(malloc(CAT_SET_BUFFER_BYTES));
        const size_t maxChars = CAT_SET_BUFFER_BYTES / sizeof(wchar_t) - 1;
        while (buffer != nullptr) {
            uint32_t count = 0;
            if (fread(&count, 1, sizeof(count), f) != sizeof(count))
                break;
            if (count > maxChars) {
                log->traceMIN(__LINE__, __FILE__, __func__,
                              "%s::%s - damaged record of %u characters, reading stopped",
                              className, __func__, static_cast<unsigned int>(count));
                break;
            }
            memset(buffer, 0, CAT_SET_BUFFER_BYTES);
            if (fread(buffer, sizeof(wchar_t), count, f) != count)
                break;
            query.addFileOrMaskForCaching(static_cast<wchar_t const*>(buffer));
        }
        free(buffer);
        fclose(f);
        return;
    }
    log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - dumping catalog set to cache.", className,
                  __func__);
    if (catSetFileName == nullptr)
        return;
    FILE* f = fopen(path.c_str(), "wb");
    if (f == nullptr)
        return;
    bool written = true;
    std::set<std::wstring>& names = query.getFilesForCaching();
    for (std::set<std::wstring>::const_iterator it = names.begin(); it != names.end(); ++it)
        written = written && writeRecord(f, *it);
    std::vector<std::wstring>& masks = query.getMasksForCaching();
    for (size_t i = 0; i < masks.size(); ++i)
        written = written && writeRecord(f, masks[i]);
    written = fflush(f) == 0 && written;
    int reason = errno;
    written = fclose(f) == 0 && written;
    if (!written) {
        // A set cut short by a full disk would be restored as a smaller set
        // and quietly narrow what later builds keep.  No saved set is the
        // state a reader knows how to take.
        unlink(path.c_str());
        log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - cannot write '%s': %s; it is removed",
                      className, __func__, path.c_str(), strerror(reason));
    }
}
