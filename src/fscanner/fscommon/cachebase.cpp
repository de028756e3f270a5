#include "fscanner/fscommon/cachebase.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <new>
#include <sys/stat.h>
#include <unistd.h>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/cache_files.h"
#include "fscanner/fscommon/cachetables.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fs/fs_query.h"
#include <ctime>
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/table.h"
#include "fscanner/fscommon/trace.h"

namespace {

// Converts text into buffer (zeroed first) with at most limit bytes.  A text
// that cannot be converted leaves the buffer empty.
void toNarrow(wchar_t const* text, char* buffer, size_t bufferSize, size_t limit)
{
    memset(buffer, 0, bufferSize);
    if (text == nullptr)
        return;
    size_t n = wcstombs(buffer, text, limit);
    if (n == static_cast<size_t>(-1))
        buffer[0] = '\0';
    buffer[bufferSize - 1] = '\0';
}

// MD5 of a name's multibyte text, as the provider mark stores it.
void digestName(wchar_t const* name, unsigned char (&digest)[16])
{
    char buffer[cachemarks::PATH_BUFFER_SIZE];
    toNarrow(name, buffer, sizeof(buffer), cachemarks::MAX_KEY_LENGTH);
    md5_context ctx;
    md5_init(&ctx);
    md5_update(&ctx, buffer, strlen(buffer));
    md5_final(&ctx, digest);
}

// The first of the two tables whose guard found damage, or null.
FS_Table* damagedTable(FS_Table* files, FS_Table* directories)
{
    if (files != nullptr && files->isDamaged())
        return files;
    if (directories != nullptr && directories->isDamaged())
        return directories;
    return nullptr;
}

// The first of the two tables that refused a write, or null.
FS_Table* refusingTable(FS_Table* files, FS_Table* directories)
{
    if (files != nullptr && files->writeFailed())
        return files;
    if (directories != nullptr && directories->writeFailed())
        return directories;
    return nullptr;
}

}  // namespace

// --- ExcludeMD5 -------------------------------------------------------------

bool ExcludeMD5::compare(unsigned int (*other)[4]) const
{
    return other != nullptr && memcmp(digest, *other, sizeof(digest)) == 0;
}

void ExcludeMD5::update(char const* /*name*/, unsigned int (*other)[4])
{
    if (other != nullptr)
        memcpy(digest, *other, sizeof(digest));
    valid = 1;
}

void ExcludeMD5::clear()
{
    name.clear();
    word = 0;
    memset(digest, 0, sizeof(digest));
    valid = 0;
}

// --- ProviderHash -------------------------------------------------------------

ProviderHash::ProviderHash(wchar_t const* name)
    : fileName(nullptr), providerName(wideDuplicate(name))
{
    memset(digest, 0, sizeof(digest));
}

ProviderHash::~ProviderHash()
{
    kelm_free(fileName);
    kelm_free(providerName);
}

bool ProviderHash::setCachePath(wchar_t const* cachePath)
{
    if (cachePath == nullptr)
        return false;
    wchar_t* name = cachefiles::providerDigestPath(cachePath);
    if (name == nullptr)
        return false;
    kelm_free(fileName);
    fileName = name;
    return true;
}

bool ProviderHash::readMd5OfProvider()
{
    return readMd5OfProvider(nullptr);
}

bool ProviderHash::readMd5OfProvider(bool* exact)
{
    if (exact != nullptr)
        *exact = false;
    if (fileName == nullptr)
        return false;
    char path[cachemarks::PATH_BUFFER_SIZE];
    toNarrow(fileName, path, sizeof(path), sizeof(path) - 1);
    return cachefiles::readProviderDigest(path, digest, exact);
}

bool ProviderHash::compareMd5OfProvider(wchar_t const* name)
{
    unsigned char other[16];
    digestName(name, other);
    return memcmp(other, digest, sizeof(digest)) == 0;
}

bool ProviderHash::updateMd5OfProvider()
{
    digestName(providerName, digest);
    return writeMd5File();
}

bool ProviderHash::writeMd5File()
{
    if (fileName == nullptr)
        return false;
    char path[cachemarks::PATH_BUFFER_SIZE];
    toNarrow(fileName, path, sizeof(path), sizeof(path) - 1);
    return cachefiles::writeProviderDigest(path, digest);
}

// --- FS_CacheBase -------------------------------------------------------------

FS_CacheBase::FS_CacheBase(wchar_t const* directoriesTable, wchar_t const* filesTable,
                           wchar_t const* cachePath, bool tableFlag_, bool cacheChecker_,
                           FsGlue* glue, wchar_t const* providerName)
    : accessMutex(nullptr), folderLog(nullptr), tbFiles(nullptr), tbDirectories(nullptr),
      filesCursor(nullptr), directoriesCursor(nullptr), directoriesCursor2(nullptr),
      filesTableName(nullptr), directoriesTableName(nullptr), cachePathName(nullptr),
      mutexName(nullptr), directoriesIndex(0), cacheInitialized(false), cacheOpened(false),
      cacheUnusable(false), tableFlag(tableFlag_), cacheChecker(cacheChecker_),
      narrowPathBuffer(nullptr), narrowPathBufferSize(0), wideNameBuffer(nullptr),
      pathMemoEdits(0), defaultVariables(nullptr), criteria(), exHashFileName(nullptr),
      providerHash(providerName), firstQuery(true), pathsChanged(true), fileSystemsChanged(true),
      className("FS_CacheBase"), log(nullptr), knownHashes(glue->knownHashes),
      checksumFlags(glue->checksumFlags), reserved(glue->reserved),
      cacheRemoteDrives(glue->cacheRemoteDrives), computeChecksums((glue->checksumFlags & 0xe0u) != 0),
      filesScanned(0), directoriesScanned(0), catSetFileName(nullptr)
{
    initObjects();
    log = getQvLogFs();
    if (directoriesTable == nullptr || filesTable == nullptr || cachePath == nullptr)
        return;
    filesTableName = wideDuplicate(filesTable);
    directoriesTableName = wideDuplicate(directoriesTable);
    cachePathName = PathHelper(1).realPath(cachePath, false);
    if (cachePathName == nullptr) {
        FS_TRACE(log, MIN, "cachePathName name is NULL, pathHelper.realPath() failed!");
        return;
    }
    exHashFileName = cachefiles::excludeDigestsPath(cachePathName);
    catSetFileName = cachefiles::catalogSetPath(cachePathName);
    providerHash.setCachePath(cachePathName);
    // One lock per real directory.
    mutexName = cachefiles::accessMutexName(cachePathName);
    if (mutexName == nullptr)
        return;
    FS_TRACE(log, MAX, "accessMutex name is '%ls'", mutexName);
    accessMutex = SysFactory::createMutex(mutexName);
    if (accessMutex == nullptr) {
        FS_TRACE(log, MIN, "accessMutex name is NULL");
        return;
    }
    if (!buildLookups())
        return;
    cacheInitialized = true;
}

FS_CacheBase::~FS_CacheBase()
{
    deleteObjects();
    forgetQueryStatistics();
}

void FS_CacheBase::initObjects()
{
    accessMutex = nullptr;
    folderLog = nullptr;
    tbFiles = nullptr;
    tbDirectories = nullptr;
    filesCursor = directoriesCursor = directoriesCursor2 = nullptr;
    filesTableName = directoriesTableName = cachePathName = mutexName = nullptr;
    narrowPathBuffer = nullptr;
    wideNameBuffer = nullptr;
    defaultVariables = nullptr;
    for (int i = 0; i < 10; ++i)
        variableHandles[i] = nullptr;
    for (int i = 0; i < 7; ++i)
        criteria[i] = nullptr;
    exHashFileName = catSetFileName = nullptr;
    excludeMd5.clear();
    lastMd5OfPaths.clear();
    cacheInitialized = cacheOpened = cacheUnusable = false;
    firstQuery = pathsChanged = fileSystemsChanged = true;
    filesScanned = directoriesScanned = 0;
}

// The tables own the cursors; the object owns only the three handles.
void FS_CacheBase::openCursors()
{
    dropCursors();
    filesCursor = new RecordSet(tbFiles->openRecordSet());
    directoriesCursor = new RecordSet(tbDirectories->openRecordSet());
    directoriesCursor2 = new RecordSet(tbDirectories->openRecordSet());
}

void FS_CacheBase::dropCursors()
{
    delete filesCursor;
    delete directoriesCursor;
    delete directoriesCursor2;
    filesCursor = directoriesCursor = directoriesCursor2 = nullptr;
}

void FS_CacheBase::deleteObjects()
{
    dropCursors();
    deleteTable(tbDirectories);
    tbDirectories = nullptr;
    deleteTable(tbFiles);
    tbFiles = nullptr;
    kelm_free(filesTableName);
    kelm_free(directoriesTableName);
    filesTableName = directoriesTableName = nullptr;
    clearPathMemo();
    deleteLookups();
    if (accessMutex != nullptr) {
        // Destroyed through its release operation first, so a held lock goes.
        accessMutex->release();
        delete accessMutex;
        accessMutex = nullptr;
    }
    delete[] exHashFileName;
    delete[] catSetFileName;
    exHashFileName = catSetFileName = nullptr;
    kelm_free(cachePathName);
    kelm_free(mutexName);
    cachePathName = mutexName = nullptr;
    kelm_free(narrowPathBuffer);
    kelm_free(wideNameBuffer);
    narrowPathBuffer = nullptr;
    wideNameBuffer = nullptr;
    closeFolderListLogfile(&folderLog);
}

void FS_CacheBase::deleteTable(FS_Table* table)
{
    delete table;
}

void FS_CacheBase::openTable(FS_Table** tableSlot, wchar_t const* name)
{
    // An object reused after close() still holds the closed tables of its
    // last run: they go before the new ones come.
    dropCursors();
    deleteTable(*tableSlot);
    *tableSlot = new FS_Table(name, cachePathName, tableFlag);
    if (!(*tableSlot)->open()) {
        delete *tableSlot;
        *tableSlot = nullptr;
    }
}

bool FS_CacheBase::createTables()
{
    dropCursors();
    deleteTable(tbFiles);
    tbFiles = nullptr;
    deleteTable(tbDirectories);
    tbDirectories = nullptr;
    if (!createFilesTable(&tbFiles, filesTableName))
        return false;
    if (!createDirectoriesTable(&tbDirectories, directoriesTableName)) {
        // The files table's files stay on disk; only the object goes.
        deleteTable(tbFiles);
        tbFiles = nullptr;
        return false;
    }
    return true;
}

bool FS_CacheBase::createCache()
{
    if (!cacheInitialized)
        return false;
    if (!createTables())
        return false;
    beginCacheUpdate();
    cacheUnusable = false;
    openCursors();
    // Arms the tables' guards for the rows this object writes and reads.
    tbFiles->verify();
    tbDirectories->verify();
    // New tables hand out ids from 1 again: nothing remembered still holds.
    clearPathMemo();
    directoriesIndex = 0;
    updateDirectoriesIDCounter();
    return true;
}

bool FS_CacheBase::openCache()
{
    if (!cacheInitialized)
        return false;
    FS_TRACE(log, MAX, "entering...");
    FS_TRACE(log, MAX, "cacheInitialized is true");
    if (insideCacheUpdate() || !getDirectoriesIDCounter() ||
        directoriesIndex >= DIRECTORIES_INDEX_LIMIT) {
        FS_TRACE_AS(log, MIN, "%s::%s() - cache corrupted or directoriesIndex invalid");
        cacheUnusable = true;
        return false;
    }
    openTable(&tbFiles, filesTableName);
    if (tbFiles == nullptr) {
        FS_TRACE(log, MIN, "open tbFiles failed!");
        return false;
    }
    openTable(&tbDirectories, directoriesTableName);
    if (tbDirectories == nullptr) {
        FS_TRACE(log, MIN, "open tbDirectories failed!");
        deleteTable(tbFiles);
        tbFiles = nullptr;
        return false;
    }
    FS_TRACE_AS(log, MAX, "%s::%s() - directoriesIndex = %d", static_cast<int>(directoriesIndex));
    beginCacheUpdate();
    cacheUnusable = false;
    openCursors();
    // The files carry no checksum; what they say of each other is checked
    // here as far as it costs the same for any size and, by the tables'
    // guards, at every read for what that read relies on.  A cache found
    // damaged here opens latched; one a query finds damaged answers -40 and
    // latches then.  Either way close removes it for a rebuild.
    std::wstring damagedFile;
    char const* failedCheck = nullptr;
    if (!cachetables::checkCacheTables(tbDirectories, tbFiles, &directoriesIndex, &damagedFile,
                                       &failedCheck)) {
        FS_TRACE(log, MIN, "damaged cache file '%ls': %s", damagedFile.c_str(),
                           failedCheck != nullptr ? failedCheck : "");
        cacheUnusable = true;
    }
    FS_TRACE(log, MAX, "cache opened!");
    return true;
}

int FS_CacheBase::create(unsigned int timeout, int creationDisposition)
{
    if (!cacheInitialized)
        return CACHE_ERROR;
    if (cacheOpened) {
        FS_TRACE(log, MIN, "retValue is CACHE_ALREADY_OPENED!");
        return CACHE_ALREADY_OPENED;
    }
    FS_TRACE(log, MAX, "timeout is %u", timeout);
    bool ok = false;
    switch (creationDisposition) {
    case FS_CACHE_CREATE:
        FS_TRACE(log, MAX, "creationDisposition is FS_CACHE_CREATE");
        ok = createCache();
        break;
    case FS_CACHE_OPEN:
        FS_TRACE(log, MAX, "creationDisposition is FS_CACHE_OPEN");
        ok = openCache();
        break;
    case FS_CACHE_OPEN_ALWAYS:
        FS_TRACE(log, MAX, "creationDisposition is FS_CACHE_OPEN_ALWAYS");
        ok = openCache() || createCache();
        break;
    default:
        FS_TRACE(log, MIN, "unknown creationDisposition %d", creationDisposition);
        break;
    }
    int result = CACHE_ERROR;
    // The reason the tables could not be made, for the caller: the checks of
    // the directory and the reading of the marks below must not replace it.
    int reason = errno;
    if (ok) {
        FS_TRACE(log, MAX, "retValue is SUCCESS");
        cacheOpened = true;
        result = SUCCESS;
    } else {
        traceCacheDirectoryProblem();
    }
    readMd5OfExclude();
    if (result != SUCCESS)
        errno = reason;
    return result;
}

int FS_CacheBase::lock()
{
    if (accessMutex == nullptr)
        return CACHE_ERROR;
    FS_TRACE(log, MAX, "waiting for accessMutex...");
    int result = SUCCESS;
    if (accessMutex->wait() == 0) {
        FS_TRACE(log, MAX, "accessMutex SUCCESS!");
    } else {
        FS_TRACE(log, MIN, "accessMutex FAILED!");
        result = CACHE_ERROR;
    }
    FS_TRACE(log, MAX, "exit. [retValue is %d]", result);
    return result;
}

int FS_CacheBase::lock(int timeout)
{
    if (accessMutex == nullptr)
        return CACHE_ERROR;
    FS_TRACE(log, MAX, "waiting for accessMutex [timeout: %d]...", timeout);
    int rc = accessMutex->wait(static_cast<long>(timeout));
    int result = SUCCESS;
    if (rc == 0) {
        FS_TRACE(log, MAX, "accessMutex SUCCESS!");
    } else if (rc == -20) {
        FS_TRACE(log, MIN, "accessMutex TIMED_OUT!");
        result = CACHE_LOCK_TIMED_OUT;
    } else {
        FS_TRACE(log, MIN, "accessMutex FAILED!");
        result = CACHE_ERROR;
    }
    FS_TRACE(log, MAX, "exit. [retValue is %d]", result);
    return result;
}

void FS_CacheBase::unlock()
{
    if (accessMutex == nullptr)
        return;
    FS_TRACE(log, MAX, "accessMutex RELEASED!");
    accessMutex->release();
}

bool FS_CacheBase::close()
{
    if (cacheInitialized) {
        if (tbFiles != nullptr)
            tbFiles->close();
        if (tbDirectories != nullptr)
            tbDirectories->close();
        // Closing the tables deleted the cursors behind the handles.
        dropCursors();
        if (cacheUnusable)
            remove();
        else
            endCacheUpdate();
    }
    return true;
}

bool FS_CacheBase::remove()
{
    if (tbFiles == nullptr || tbDirectories == nullptr)
        return false;
    bool filesErased = tbFiles->erase();
    bool directoriesErased = tbDirectories->erase();
    removeDirectoriesIDCounter();
    removeMd5FromExcludes();
    removeCatSet();
    // pr_hash stays: that mark outlives the cache.
    return filesErased && directoriesErased;
}

bool FS_CacheBase::compact()
{
    if (!cacheInitialized)
        return false;
    if (insideCacheUpdate()) {
        cacheUnusable = true;
        return false;
    }
    if (tbFiles == nullptr || tbDirectories == nullptr)
        return false;
    // The update flag covers the copy: a compaction cut short leaves a cache
    // that the next create refuses to open.
    beginCacheUpdate();
    bool directoriesDone = tbDirectories->compact(30);
    bool filesDone = tbFiles->compact(30);
    if (!directoriesDone || !filesDone)
        cacheUnusable = true;
    endCacheUpdate();
    return directoriesDone && filesDone;
}

namespace {

std::string narrowName(wchar_t const* name)
{
    char buffer[cachemarks::PATH_BUFFER_SIZE + 1];
    toNarrow(name, buffer, sizeof(buffer), cachemarks::PATH_BUFFER_SIZE);
    return std::string(buffer);
}

// A side file of the cache (the update flag, the id counter) by the name
// cachefiles makes for it: wide for the traces, narrow for the file calls.
// made is false when no name could be made; the new[] block is released here.
struct SideFile {
    explicit SideFile(wchar_t* name) : made(name != nullptr)
    {
        if (!made)
            return;
        wide = name;
        narrow = narrowName(name);
        delete[] name;
    }
    bool made;
    std::wstring wide;
    std::string narrow;
};

}  // namespace

// The likeliest reason a cache cannot be opened or made is its directory:
// the engine never makes it, so a host that forgot to gets this trace instead
// of only the one about a damaged cache.
void FS_CacheBase::traceCacheDirectoryProblem()
{
    // Called right after the failure: errno is still the reason of the
    // write that failed, if one did.
    int reason = errno;
    if (cachePathName == nullptr)
        return;
    std::string directory = narrowName(cachePathName);
    fscanner::Env* env = fscanner::Env::Current();
    struct stat status;
    char const* problem = nullptr;
    int error = 0;
    if (env->status(directory.c_str(), &status) != 0) {
        error = errno;
        problem = error == ENOENT ? "does not exist" : "cannot be examined";
    } else if (!S_ISDIR(status.st_mode)) {
        problem = "is not a directory";
    } else if (env->checkAccess(directory.c_str(), W_OK | X_OK) != 0) {
        error = errno;
        problem = "is not writable";
    } else if (reason == ENOSPC || reason == EDQUOT) {
        error = reason;
        problem = "is on a full file system";
    }
    if (problem == nullptr)
        return;
    FS_TRACE(log, MIN, "cache directory '%s' %s%s%s", directory.c_str(), problem,
                       error != 0 ? ": " : "", error != 0 ? strerror(error) : "");
}

bool FS_CacheBase::insideCacheUpdate()
{
    if (!cacheChecker) {
        FS_TRACE(log, MAX, "cacheChecker disabled!");
        return false;
    }
    SideFile flag(cachefiles::updateFlagPath(cachePathName, directoriesTableName));
    bool inside = flag.made && cachefiles::updateFlagPresent(flag.narrow.c_str());
    FS_TRACE(log, MAX, "inside cache update = %s", inside ? "true" : "false");
    return inside;
}

void FS_CacheBase::beginCacheUpdate()
{
    if (!cacheChecker)
        return;
    SideFile flag(cachefiles::updateFlagPath(cachePathName, directoriesTableName));
    if (!flag.made)
        return;
    FS_TRACE(log, MAX, "begin cache update: %ls", flag.wide.c_str());
    cachefiles::createUpdateFlag(flag.narrow.c_str());
}

void FS_CacheBase::endCacheUpdate()
{
    if (!cacheChecker)
        return;
    SideFile flag(cachefiles::updateFlagPath(cachePathName, directoriesTableName));
    if (!flag.made)
        return;
    FS_TRACE(log, MAX, "end cache update: %ls", flag.wide.c_str());
    cachefiles::removeSideFile(flag.narrow.c_str());
}

bool FS_CacheBase::getDirectoriesIDCounter()
{
    SideFile counter(cachefiles::counterPath(cachePathName, directoriesTableName));
    if (!counter.made)
        return false;
    uint32_t value = 0;
    bool ok = cachefiles::readCounter(counter.narrow.c_str(), &value);
    if (ok)
        directoriesIndex = value;
    return ok;
}

bool FS_CacheBase::updateDirectoriesIDCounter()
{
    SideFile counter(cachefiles::counterPath(cachePathName, directoriesTableName));
    return counter.made && cachefiles::writeCounter(counter.narrow.c_str(), directoriesIndex);
}

void FS_CacheBase::removeDirectoriesIDCounter()
{
    SideFile counter(cachefiles::counterPath(cachePathName, directoriesTableName));
    if (counter.made)
        cachefiles::removeSideFile(counter.narrow.c_str());
}

void FS_CacheBase::removeCatSet()
{
    if (catSetFileName == nullptr)
        return;
    cachefiles::removeSideFile(narrowName(catSetFileName).c_str());
}

wchar_t* FS_CacheBase::getCacheFileName(wchar_t const* directory, wchar_t const* name,
                                        wchar_t const* suffix)
{
    return cachefiles::cacheFileName(directory, name, suffix);
}

void FS_CacheBase::getMd5OfPaths(std::vector<PathInfo>& included, std::vector<PathInfo>& excluded,
                                 std::string& result)
{
    // Room past the 4,096 bytes so that appending the marker to a full text
    // stays in bounds; only the first 9 bytes are ever fed after it.
    char buffer[cachemarks::PATH_BUFFER_SIZE + sizeof(cachemarks::PATHS_BREAK_MARKER)];
    memset(buffer, 0, sizeof(buffer));
    md5_context ctx;
    md5_init(&ctx);
    for (size_t i = 0; i < included.size(); ++i) {
        wchar_t const* path = included[i].getPathName();
        if (path != nullptr && (wcsncasecmp(path, L"$remote::", 9) == 0 ||
                                wcsncasecmp(path, L"$all::", 6) == 0 ||
                                wcsncasecmp(path, L"$other::", 8) == 0)) {
            result.clear();
            FS_TRACE(log, MAX, "md5 returned: '%s'", result.c_str());
            return;
        }
        FS_TRACE(log, MAX, "md5 get of '%S'", path != nullptr ? path : L"");
        toNarrow(path, buffer, sizeof(buffer), cachemarks::MAX_KEY_LENGTH);
        CpuThreshold::doIteration();
        md5_update(&ctx, buffer, strlen(buffer));
    }
    // The marker goes after the last path's text in the same buffer, and only
    // the first 9 bytes are fed: existing caches' digests depend on this.
    strcat(buffer, cachemarks::PATHS_BREAK_MARKER);
    md5_update(&ctx, buffer, cachemarks::PATHS_BREAK_FED);
    for (size_t i = 0; i < excluded.size(); ++i) {
        toNarrow(excluded[i].getPathName(), buffer, sizeof(buffer), cachemarks::MAX_KEY_LENGTH);
        md5_update(&ctx, buffer, strlen(buffer));
    }
    unsigned char digest[16];
    md5_final(&ctx, digest);
    char text[MD5_TEXT_SIZE];
    md5_tostr(digest, text);
    result = text;
    FS_TRACE(log, MAX, "md5 returned: '%s'", result.c_str());
}

void FS_CacheBase::exclusionDigest(std::vector<PathInfo>& excludes, bool throttle,
                                   unsigned int (*digest)[4])
{
    memset(*digest, 0, sizeof(*digest));
    if (excludes.empty())
        return;
    char buffer[cachemarks::PATH_BUFFER_SIZE];
    md5_context ctx;
    md5_init(&ctx);
    for (size_t i = 0; i < excludes.size(); ++i) {
        wchar_t const* path = excludes[i].getPathName();
        toNarrow(path, buffer, sizeof(buffer), cachemarks::MAX_KEY_LENGTH);
        for (char* p = buffer; *p != '\0'; ++p) {
            if (*p == '\\')
                *p = '/';
        }
        FS_TRACE(log, MAX, "md5 update for '%S' path of '%s'", path != nullptr ? path : L"", buffer);
        if (throttle)
            CpuThreshold::doIteration();
        md5_update(&ctx, buffer, strlen(buffer));
    }
    md5_final(&ctx, *digest);
}

std::string FS_CacheBase::exclusionKey(wchar_t const* root)
{
    char buffer[cachemarks::PATH_BUFFER_SIZE];
    toNarrow(root, buffer, sizeof(buffer), cachemarks::MAX_KEY_LENGTH);
    size_t n = strlen(buffer);
    if (n > 0 && (buffer[n - 1] == '/' || buffer[n - 1] == '\\'))
        buffer[n - 1] = '\0';
    return std::string(buffer);
}

bool FS_CacheBase::compareMd5OfExclude(std::vector<PathInfo>& excludes, wchar_t const* root)
{
    unsigned int digest[4];
    exclusionDigest(excludes, true, &digest);
    std::string key = exclusionKey(root);
    // operator[] on purpose: a new root gets a zero entry, so a root with no
    // excludes compares as equal even though it was never built.
    bool same = excludeMd5[key].compare(&digest);
    char text[MD5_TEXT_SIZE];
    md5_tostr(digest, text);
    FS_TRACE(log, MAX, "md5 res returned: '%s'", same ? "true" : "false");
    FS_TRACE(log, MAX, "md5 res for filename '%s': '%s'", key.c_str(), text);
    return same;
}

void FS_CacheBase::updateMd5OfExclude(std::vector<PathInfo>& excludes, wchar_t const* root)
{
    unsigned int digest[4];
    exclusionDigest(excludes, false, &digest);
    std::string key = exclusionKey(root);
    excludeMd5[key].update(key.c_str(), &digest);
    char text[MD5_TEXT_SIZE];
    md5_tostr(digest, text);
    FS_TRACE(log, MAX, "md5 returned: '%s'", text);
    writeMd5File();
}

void FS_CacheBase::writeMd5File()
{
    if (exHashFileName == nullptr)
        return;
    char path[cachemarks::PATH_BUFFER_SIZE + 1];
    toNarrow(exHashFileName, path, sizeof(path), cachemarks::PATH_BUFFER_SIZE);
    std::vector<cachefiles::ExcludeDigest> records;
    for (std::map<std::string, ExcludeMD5>::const_iterator it = excludeMd5.begin();
         it != excludeMd5.end(); ++it) {
        if (!it->second.valid)
            continue;
        cachefiles::ExcludeDigest record;
        record.key = it->first;
        memcpy(record.digest, it->second.digest, sizeof(record.digest));
        records.push_back(record);
    }
    bool opened = false;
    bool written = cachefiles::writeExcludeDigests(path, records, &opened);
    int reason = errno;
    if (!opened)
        return;  // a mark that cannot be made is a missing mark: silent
    for (std::map<std::string, ExcludeMD5>::const_iterator it = excludeMd5.begin();
         it != excludeMd5.end(); ++it)
        FS_TRACE(log, MAX, "md5 write of '%s'", it->first.c_str());
    // A file cut short by a full disk holds only whole records before the
    // cut, which the reader keeps; the roots whose records are missing count
    // as built under other excludes and are rebuilt.  That is the promise of
    // a missing mark, so no wrong tree is served: the failure is traced only.
    if (!written)
        FS_TRACE(log, MIN, "cannot write '%s': %s", path, strerror(reason));
}

void FS_CacheBase::readMd5OfExclude()
{
    if (exHashFileName == nullptr)
        return;
    char path[cachemarks::PATH_BUFFER_SIZE + 1];
    toNarrow(exHashFileName, path, sizeof(path), cachemarks::PATH_BUFFER_SIZE);
    std::vector<cachefiles::ExcludeDigest> records;
    cachefiles::ReadEnd end;
    uint32_t damagedLength = 0;
    if (!cachefiles::readExcludeDigests(path, &records, &end, &damagedLength))
        return;
    // Whatever stopped the reading, the whole records before it count.
    for (size_t i = 0; i < records.size(); ++i) {
        unsigned int digest[4];
        memcpy(digest, records[i].digest, sizeof(digest));
        excludeMd5[records[i].key].update(records[i].key.c_str(), &digest);
    }
    if (end == cachefiles::DAMAGED_RECORD)
        FS_TRACE(log, MIN, "damaged record length %u in '%s', reading stopped",
                           static_cast<unsigned int>(damagedLength), path);
}

void FS_CacheBase::removeMd5FromExcludes()
{
    if (exHashFileName == nullptr)
        return;
    char path[cachemarks::PATH_BUFFER_SIZE + 1];
    toNarrow(exHashFileName, path, sizeof(path), cachemarks::PATH_BUFFER_SIZE);
    cachefiles::removeSideFile(path);
}

// --- query driver ---------------------------------------------------------------

int FS_CacheBase::executeQueryEx(FsResultSetWriter& writer, FsQuery const& query,
                                 unsigned int timeout, unsigned int maxCacheAge)
{
    FS_TRACE_AS(log, MID, "%s::%s called with: query: '%S', timeout=%d, maxCacheAge=%d",
                          query.getQuery() != nullptr ? query.getQuery() : L"",
                          static_cast<int>(timeout), static_cast<int>(maxCacheAge));
    queryStatistics().reset();
    if (!cacheInitialized || !cacheOpened || cacheUnusable)
        return CACHE_UNUSABLE;
    unsigned int indexBefore = directoriesIndex;
    int result = executeQueryCacheOnlyEx(writer, query, timeout, maxCacheAge);
    int reason = errno;  // of a CACHE_ERROR, given back to the caller
    // A read that met damage ended its walk early: what the writer got is
    // not the answer, whatever the flow returned.
    if (FS_Table* damaged = damagedTable(tbFiles, tbDirectories)) {
        FS_TRACE(log, MIN, "damaged cache file '%ls': %s", damaged->damagedFile(),
                           damaged->damagedCheck());
        result = CACHE_UNUSABLE;
    }
    if (result == CACHE_UNUSABLE || result == BUILD_TIMED_OUT) {
        cacheUnusable = true;
        return result;
    }
    // A refused build took its own rows back, but roots built before it in
    // this query keep theirs: the counter must cover their ids, or the next
    // open would find ids it never gave and refuse the whole cache.
    if ((result == SUCCESS || result == CACHE_ERROR) && directoriesIndex > indexBefore &&
        !updateDirectoriesIDCounter()) {
        int counterReason = errno;
        FS_TRACE(log, MIN, "cannot save the directory id counter: %s", strerror(counterReason));
        if (result == SUCCESS) {
            result = CACHE_ERROR;
            reason = counterReason;
        }
    }
    if (result == CACHE_ERROR)
        errno = reason;
    return result;
}

int FS_CacheBase::executeQueryCacheOnlyEx(FsResultSetWriter& writer, FsQuery const& query,
                                          unsigned int timeout, unsigned int maxCacheAge)
{
    // A. Set-up.  All age tests of this query use one clock reading.
    time_t now = time(nullptr);
    CpuThreshold::Initialize(query.getCpuThreshold());
    DriveHelper driveHelper;
    PathHelper pathHelper(1);
    bool caseFlag = query.getCaseSensitive();

    // B. First query only: the drive list is built once per object.
    if (firstQuery) {
        char const* threshold = query.getCpuThreshold();
        int a = 0, b = 0;
        long run = 0, sleepTime = 0;
        int fields = threshold != nullptr ? sscanf(threshold, "%d:%d:%ld:%ld", &a, &b, &run, &sleepTime)
                                          : 0;
        if (threshold == nullptr || fields < 4) {
            FS_TRACE_AS(log, MIN, "IMPORTANT: %s::%s - CpuThreshold is set to: 0:0:0:0");
        } else if (sleepTime == 0 || run + sleepTime == 0) {
            FS_TRACE_AS(log, MIN, "IMPORTANT: %s::%s - CpuThreshold is set to : 100%% (%s).",
                                  threshold);
        } else {
            float percent = static_cast<float>(run) / static_cast<float>(run + sleepTime) * 100.0f;
            FS_TRACE_AS(log, MIN, "IMPORTANT: %s::%s - CpuThreshold is set to: %0.1f%% (%s).",
                                  static_cast<double>(percent), threshold);
        }
        driveList.clear();
        driveHelper.setAssumeAutoFSDriveType(query.getAssumeAutoFSDriveType());
        driveHelper.buildDriveList(driveList, mdAllDrives);
        prunedDriveList.clear();
        driveHelper.fileSystemDriveListPruning(driveList, prunedDriveList, prevIncludedFileSystems,
                                               prevExcludedFileSystems, caseFlag, prevExcludedPaths);
        drivePaths.clear();
        prunedDrivePaths.clear();
        droppedDrivePaths.clear();
        pathHelper.buildPathList(driveList, drivePaths);
        pathHelper.buildPathList(prunedDriveList, prunedDrivePaths);
        pathHelper.differencePathList(drivePaths, prunedDrivePaths, droppedDrivePaths);
    }

    // C. Change detection.
    bool firstTimeOnly = query.getFirstTimeOnly();
    if (firstTimeOnly && !firstQuery) {
        // Such a query only reads the cache, with the lists of the last
        // resolution.
        return extractFromCache(writer, query, pathHelper, caseFlag, timeout);
    }
    std::vector<PathInfo>& included = query.getIncludedPaths();
    std::vector<PathInfo>& excluded = query.getExcludedPaths();
    if (firstTimeOnly || firstQuery || !samePathList(included, prevIncludedPaths) ||
        !samePathList(excluded, prevExcludedPaths)) {
        prevIncludedPaths = included;
        prevExcludedPaths = excluded;
        prevIncludedFileSystems = query.getIncludedFileSystems();
        prevExcludedFileSystems = query.getExcludedFileSystems();
        pathsChanged = true;
        fileSystemsChanged = true;
    } else {
        pathsChanged = false;
        if (!sameFileSystemList(query.getIncludedFileSystems(), prevIncludedFileSystems) ||
            !sameFileSystemList(query.getExcludedFileSystems(), prevExcludedFileSystems)) {
            prevIncludedFileSystems = query.getIncludedFileSystems();
            prevExcludedFileSystems = query.getExcludedFileSystems();
            fileSystemsChanged = true;
        } else {
            fileSystemsChanged = false;
        }
    }

    // D. Resolution, unless nothing changed.
    if (firstQuery || pathsChanged || fileSystemsChanged) {
        std::vector<PathInfo> excludedCopy = excluded;
        prunedDriveList.clear();
        driveHelper.fileSystemDriveListPruning(driveList, prunedDriveList, prevIncludedFileSystems,
                                               prevExcludedFileSystems, caseFlag, excludedCopy);
        drivePaths.clear();
        prunedDrivePaths.clear();
        droppedDrivePaths.clear();
        pathHelper.buildPathList(driveList, drivePaths);
        pathHelper.buildPathList(prunedDriveList, prunedDrivePaths);
        pathHelper.differencePathList(drivePaths, prunedDrivePaths, droppedDrivePaths);
        includeParentResolved.clear();
        includeResolved.clear();
        includeExcluded.clear();
        includeUnresolved.clear();
        includeRoots.clear();
        excludeParentResolved.clear();
        excludeResolved.clear();
        excludeExcluded.clear();
        excludeUnresolved.clear();
        localIncludePaths.clear();
        localExcludePaths.clear();
        remoteIncludePaths.clear();
        remoteExcludePaths.clear();
        scanExcludePaths.clear();
        scanIncludePaths.clear();
        pathHelper.pathResolver(prevIncludedPaths, prunedDriveList, prunedDrivePaths,
                                droppedDrivePaths, includeParentResolved, includeResolved,
                                includeExcluded, includeUnresolved, mdLocalDriveGroup);
        pathHelper.pathResolver(excludedCopy, prunedDriveList, prunedDrivePaths, droppedDrivePaths,
                                excludeParentResolved, excludeResolved, excludeExcluded,
                                excludeUnresolved, mdAllDrives);
        pathHelper.pathDriveAccumulator(includeParentResolved, includeRoots, true);
        pathHelper.extractPathList(includeResolved, mdLocalDriveGroup, localIncludePaths);
        pathHelper.extractPathList(excludeResolved, mdLocalDriveGroup, localExcludePaths);
        pathHelper.extractPathList(includeResolved, mdRemoteDriveGroup, remoteIncludePaths);
        pathHelper.extractPathList(includeResolved, mdOtherDriveGroup, remoteIncludePaths);
    }

    // E. Marks.
    std::string md5;
    getMd5OfPaths(prevIncludedPaths, prevExcludedPaths, md5);
    bool cacheValid;
    bool markExact = false;
    if (!providerHash.readMd5OfProvider(&markExact)) {
        cacheValid = false;
        FS_TRACE(log, MID, "(cacheValid check1) unable to determine previous provider, therefore cache is invalid.");
    } else if (!providerHash.compareMd5OfProvider(providerHash.providerName)) {
        cacheValid = false;
        FS_TRACE(log, MID, "(cacheValid check1) previous provider differs, therefore cache is invalid.");
    } else {
        cacheValid = true;
    }
    // A mark that already holds exactly this provider's digest is left
    // alone: rewriting the same 16 bytes at every query only dirties the
    // directory's disk for the next sync.
    bool markCurrent = cacheValid && markExact;
    if (!markCurrent && !providerHash.updateMd5OfProvider())
        FS_TRACE(log, MID, "(cacheValid check1) failed to update previous cache MD5 for future scans!");
    saveOrRestoreFilesOrMasksForCaching(query);

    // F. Visit the roots, unless this object saw the same paths last time:
    // then neither the age nor the excludes are looked at again.
    if (lastMd5OfPaths.empty() || lastMd5OfPaths != md5) {
        time_t visitStart = time(nullptr);
        bool anyBuilt = false;
        for (size_t i = 0; i < includeParentResolved.size(); ++i) {
            CpuThreshold::doIteration();
            PathDrive& root = includeParentResolved[i];
            wchar_t const* rootPath = root.getPathName() != nullptr ? root.getPathName() : L"";
            bool remote = !cacheRemoteDrives &&
                          (static_cast<unsigned int>(root.getDriveType()) & mdLocalDriveGroup) == 0;
            if (remote) {
                FS_TRACE(log, MID, "scanning [mdRemoteDriveGroup] and [mdOtherDriveGroup] [%S] path...",
                                   rootPath);
                remoteExcludePaths.clear();
                pathHelper.extractPathList(excludeResolved, mdRemoteDriveGroup, remoteExcludePaths);
                pathHelper.extractPathList(excludeResolved, mdOtherDriveGroup, remoteExcludePaths);
                pathHelper.buildExcludeList(driveList, root, remoteExcludePaths);
                pathHelper.fillExclude(root, excludeResolved, remoteExcludePaths);
                int rc;
                {
                    FsQueryStatistics& statistics = queryStatistics();
                    ++statistics.rootsWalked;
                    FileProcessor processor(query.getQuery(), caseFlag);
                    rc = fs_build(writer, processor, root, remoteIncludePaths, remoteExcludePaths,
                                  caseFlag, 2000000000, &statistics);
                }
                // The walk's commands are gone with its processor; their names
                // must not stay in the shared table, where they would change
                // how the cache's criteria parse on their first use (see the
                // end of extractResults).
                cmdTokenTable().clear();
                if (rc == 2) {
                    FS_TRACE(log, MIN, "fs scanning timed out (timeout)");
                    return SCAN_TIMED_OUT;
                }
                continue;
            }

            int rc = visitLocalRoot(query, root, pathHelper, caseFlag, timeout, maxCacheAge, now,
                                    cacheValid);
            if (rc == -1)
                ++queryStatistics().rootsFromCache;
            else
                ++queryStatistics().rootsRebuilt;
            if (rc == 2)
                return BUILD_TIMED_OUT;
            // errno is the reason, from visitLocalRoot: nothing may run here
            // that could change it.
            if (rc == 3)
                return CACHE_ERROR;
            if (rc != -1)
                anyBuilt = true;
        }

        if (anyBuilt) {
            long t = static_cast<long>(time(nullptr) - visitStart);
            char summary[512];
            if (t == 0) {
                log->traceMIN(__LINE__, __FILE__, __func__,
                              "IMPORTANT: BUILDING CACHE SUMMARY - %d files and %d directories scanned. Scan duration 0 seconds.",
                              filesScanned, directoriesScanned);
                snprintf(summary, sizeof(summary),
                         "File system scan finished - %d files and %d directories scanned.\nScan duration 0 seconds.",
                         filesScanned, directoriesScanned);
            } else {
                int rate = static_cast<int>((directoriesScanned + filesScanned) / t);
                log->traceMIN(__LINE__, __FILE__, __func__,
                              "IMPORTANT: BUILDING CACHE SUMMARY - %d files and %d directories scanned. Scan duration '%ld' hours '%ld' minutes '%ld' seconds. %d entries per second.",
                              filesScanned, directoriesScanned, t / 3600, (t % 3600) / 60, t % 60,
                              rate);
                snprintf(summary, sizeof(summary),
                         "File system scan finished - %d files and %d directories scanned.\nScan duration '%ld' hours '%ld' minutes '%ld' seconds. %d entries per second.",
                         filesScanned, directoriesScanned, t / 3600, (t % 3600) / 60, t % 60, rate);
            }
            logString(folderLog, summary);
        }
        closeFolderListLogfile(&folderLog);
        if (!md5.empty())
            lastMd5OfPaths = md5;
    }

    // G.
    firstQuery = false;
    // H.
    return extractFromCache(writer, query, pathHelper, caseFlag, timeout);
}

namespace {
// The local branch and the extraction are steps of executeQueryCacheOnlyEx;
// their traces carry its name.
char const driverName[] = "executeQueryCacheOnlyEx";
}  // namespace

int FS_CacheBase::visitLocalRoot(FsQuery const& query, PathDrive& root, PathHelper& pathHelper,
                                 bool caseFlag, unsigned int timeout, unsigned int maxCacheAge,
                                 time_t now, bool& cacheValid)
{
    wchar_t const* rootPath = root.getPathName() != nullptr ? root.getPathName() : L"";
    wchar_t const* driveName = root.getDriveName() != nullptr ? root.getDriveName() : L"";
    wchar_t const* driveFs = root.getDriveFileSystem() != nullptr ? root.getDriveFileSystem() : L"";
    int driveType = static_cast<int>(root.getDriveType());
    log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - scanning [mdLocalDriveGroup] [%S] path...",
                  className, driverName, rootPath);

    // findPathByName takes a writable path: give it a private copy.
    std::vector<wchar_t> pathCopy(rootPath, rootPath + wcslen(rootPath) + 1);
    bool found = findPathByName(*directoriesCursor, *directoriesCursor2, pathCopy.data(), caseFlag);

    if (cacheValid) {
        if (!found) {
            cacheValid = false;
        } else {
            // Unsigned 32-bit arithmetic, as the table stores the time.
            uint32_t created = directoriesCursor->getFieldAsInt32(L"CREATIONTIME");
            uint32_t limit = static_cast<uint32_t>(now) - static_cast<uint32_t>(maxCacheAge);
            if (created < limit)
                cacheValid = false;
        }
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - (cacheValid check2) cache is valid: %s",
                      className, driverName, cacheValid ? "true" : "false");
    }
    unsigned int rootId = found ? directoriesCursor->getFieldAsInt32(L"ID") : 0;

    scanExcludePaths.clear();
    pathHelper.extractPathList(includeExcluded, cacheRemoteDrives ? mdAllDrives : mdLocalDriveGroup,
                               scanExcludePaths);
    pathHelper.buildExcludeList(driveList, root, scanExcludePaths);
    pathHelper.fillExclude(root, excludeResolved, scanExcludePaths);
    std::sort(scanExcludePaths.begin(), scanExcludePaths.end(),
              [](PathInfo const& a, PathInfo const& b) { return a.operator<(b); });

    if (cacheValid) {
        cacheValid = compareMd5OfExclude(scanExcludePaths, rootPath);
        log->traceMID(__LINE__, __FILE__, __func__,
                      "%s::%s - (cacheIsValid check3) cache is valid: %s", className, driverName,
                      cacheValid ? "true" : "false");
    }
    log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - cacheIsValid for [%S]: %s.", className,
                  driverName, rootPath, cacheValid ? "true" : "false");

    if (found && cacheValid) {
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "IMPORTANT: %s::%s - retrieving data from cache for '%S' (drive: '%S', type: %d, fs: '%S')",
                      className, driverName, rootPath, driveName, driveType, driveFs);
        return -1;
    }
    if (found) {
        log->traceMID(__LINE__, __FILE__, __func__,
                      "%s::%s - Existing tree for '%S' in the cache is not valid. Removing it, then recreating.",
                      className, driverName, rootPath);
        removeTree(tbDirectories, tbFiles, rootId);
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - tree removed!", className, driverName);
    }

    // A cached root is always built recursively, whatever the query said.
    PathDrive pathDrive(rootPath, true, static_cast<DriveInfo const&>(root));
    log->traceMIN(__LINE__, __FILE__, __func__,
                  "IMPORTANT: File system access on '%S' (drive: '%S', type: %d, fs: '%S')", rootPath,
                  driveName, driveType, driveFs);
    if (folderLog == nullptr && openFolderListLogfile(&folderLog))
        log->traceMID(__LINE__, __FILE__, __func__,
                      "%s::%s - Failed to open file to store scanned directories list, errno=%d",
                      className, driverName, errno);

    // Every row this build writes has an id above this one.
    unsigned int lastKeptId = directoriesIndex;
    tbFiles->clearWriteFailure();
    tbDirectories->clearWriteFailure();
    int rc = build(query, pathDrive, *directoriesCursor, directoriesIndex, *filesCursor,
                   *directoriesCursor2, scanIncludePaths, scanExcludePaths, caseFlag,
                   static_cast<int>(timeout));
    if (folderLog != nullptr)
        fflush(folderLog);

    // A table that refused a write (a full disk) refused every row after it
    // too, so the tree is incomplete whatever the walk returned: its rows go
    // again, and the rest of the cache stays as it was before this root.
    if (FS_Table* refused = refusingTable(tbFiles, tbDirectories)) {
        int reason = refused->writeError();
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "IMPORTANT: %s::%s - (WRITE FAILED) cannot write the cache file '%ls' while building '%S': %s; the rows of this build are removed",
                      className, driverName, refused->failedWriteFile(), rootPath,
                      reason != 0 ? strerror(reason) : "unknown reason");
        removeRowsAbove(lastKeptId);
        tbFiles->clearWriteFailure();
        tbDirectories->clearWriteFailure();
        errno = reason;
        return 3;
    }

    if (rc == 0) {
        updateMd5OfExclude(scanExcludePaths, rootPath);
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "IMPORTANT: (OK) File system access on '%S' (drive: '%S', type: %d, fs: '%S')",
                      rootPath, driveName, driveType, driveFs);
        // Deliberate: after a provider change only the roots up to the first
        // rebuilt one are rebuilt for that reason.
        cacheValid = true;
        return 0;
    }
    if (rc == 2) {
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "IMPORTANT: (TIMEOUT) File system access on '%S' (drive: '%S', type: %d, fs: '%S')",
                      rootPath, driveName, driveType, driveFs);
        return 2;
    }
    log->traceMIN(__LINE__, __FILE__, __func__,
                  "IMPORTANT: (ACCESS FAILED) File system access on '%S' (drive: '%S', type: %d, fs: '%S')",
                  rootPath, driveName, driveType, driveFs);
    return 1;
}

void FS_CacheBase::removeRowsAbove(unsigned int lastKeptId)
{
    if (tbDirectories == nullptr || tbFiles == nullptr)
        return;
    // Ids of removed rows must not be answered from the memo any more.
    clearPathMemo();
    // By id, not by walking down from the root: a directory row the disk
    // refused leaves its files and subdirectories unreachable.  Removal only
    // zeroes slots and rewrites counts in place.
    RecordSet set = tbDirectories->openRecordSet();
    for (unsigned int id = lastKeptId + 1; id > lastKeptId && id <= directoriesIndex; ++id) {
        removeFiles(tbFiles, id);
        for (bool row = lookUp(set, cachetables::CRIT_ID, L"ID", cachetables::VAR_ID, id, nullptr,
                               true);
             row; row = set.moveNext())
            set.remove();
    }
    if (!tbDirectories->closeRecordSet(set))
        FS_TRACE(log, MIN, "closeRecordSet failed!");
}

int FS_CacheBase::extractFromCache(FsResultSetWriter& writer, FsQuery const& query,
                                   PathHelper& pathHelper, bool caseFlag, unsigned int timeout)
{
    if (cacheRemoteDrives) {
        localIncludePaths.insert(localIncludePaths.end(), remoteIncludePaths.begin(),
                                 remoteIncludePaths.end());
        localExcludePaths.insert(localExcludePaths.end(), remoteExcludePaths.begin(),
                                 remoteExcludePaths.end());
    }
    pathHelper.removePathListDuplicate(localIncludePaths);
    pathHelper.removePathListDuplicate(localExcludePaths);
    int result;
    if (filesCursor != nullptr && directoriesCursor != nullptr) {
        result = extractResults(writer, query.getQuery(), driveList, includeParentResolved,
                                localIncludePaths, localExcludePaths, *filesCursor,
                                *directoriesCursor, caseFlag, static_cast<int>(timeout));
    } else if (localIncludePaths.empty()) {
        // Nothing to read: extraction ends before it touches a cursor.
        RecordSet none;
        result = extractResults(writer, query.getQuery(), driveList, includeParentResolved,
                                localIncludePaths, localExcludePaths, none, none, caseFlag,
                                static_cast<int>(timeout));
    } else {
        log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - cache cursors are not open!",
                      className, driverName);
        result = CACHE_UNUSABLE;
    }
    log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - exit. [retValue is %d]", className,
                  driverName, result);
    return result;
}
