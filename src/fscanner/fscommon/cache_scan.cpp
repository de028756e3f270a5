// The cache's only writer of rows: build puts one root into the directories
// table and scan walks the tree below it, one row per directory and one per
// cacheable file.
//
// The walk shares one millisecond budget: each level notes the tick count
// after reading its directory and hands every child what is left of its own
// budget.  The budget is only tested on entering a level, so a directory with
// very many files is never cut in the middle.

#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <cwchar>
#include <string>
#include <vector>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

// Longest directory path, in wide characters, the scan enters.
const size_t SCAN_MAX_PATH = 0xfff;
// Room of a full narrow file path for the checksum pass, in bytes.
const size_t SCAN_NARROW_PATH_BYTES = 4096;

// Local file sets of the distributed file system, shared by every cache
// object of the process and loaded at most once.  Unguarded, as the scan of
// one object is single-threaded and the list is only read after loading.
StringList<char>* dfsLocalNames = nullptr;
bool dfsLocalNamesLoaded = false;
bool dfsLocalNamesToTry = true;

// Grows a kelm_malloc scratch block to hold at least need elements of
// elementSize bytes.  The block is never shrunk.
bool growScratch(void** block, size_t* size, size_t need, size_t elementSize)
{
    if (*size >= need && *block != nullptr)
        return true;
    void* grown = kelm_realloc(*block, need * elementSize);
    if (grown == nullptr)
        return false;
    *block = grown;
    *size = need;
    return true;
}

// directory + name as a narrow path within SCAN_NARROW_PATH_BYTES; false when
// either part does not convert or the result does not fit.
bool narrowFilePath(wchar_t const* directory, wchar_t const* name, char* out)
{
    size_t used = wcstombs(out, directory, SCAN_NARROW_PATH_BYTES);
    if (used == static_cast<size_t>(-1) || used >= SCAN_NARROW_PATH_BYTES)
        return false;
    size_t more = wcstombs(out + used, name, SCAN_NARROW_PATH_BYTES - used);
    if (more == static_cast<size_t>(-1) || used + more >= SCAN_NARROW_PATH_BYTES)
        return false;
    out[used + more] = '\0';
    return true;
}

// Why the status of directory/name cannot be read, for the statistics: the
// status call is made again, as the first one's errno may be gone.  0 when it
// now succeeds.
int statusError(std::string const& directory, char const* name)
{
    std::string path = directory;
    if (path.empty() || path.back() != '/')
        path += '/';
    path += name;
    struct stat status;
    return lstat(path.c_str(), &status) == 0 ? 0 : errno;
}

}  // namespace

void (*FS_CacheBase::scanHook)(char const* directory) = nullptr;

int FS_CacheBase::build(FsQuery const& query, PathDrive& root, RecordSet& directories,
                        unsigned int& directoriesIndex, RecordSet& files, RecordSet& directories2,
                        std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes,
                        bool caseSensitive, int timeoutMs)
{
    log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - entry.", className, __func__);
    int logDepth = getNestedFolderDepthForLogging();
    wchar_t const* rootPath = root.getPathName();
    if (rootPath == nullptr || rootPath[0] == L'\0')
        return 0;

    // The levels of the root, deepest first, and their last components.
    PathHelper pathHelper(1);
    std::vector<PathInfo> prefixes;
    std::vector<PathInfo> names;
    pathHelper.pathReducer(PathInfo(root), prefixes, names);

    // The deepest level already in the table gives the parent of the rest.
    unsigned int parentId = 0;
    size_t missing = prefixes.size();
    for (size_t i = 0; i < prefixes.size(); ++i) {
        wchar_t const* prefix = prefixes[i].getPathName();
        if (prefix == nullptr)
            continue;
        std::vector<wchar_t> copy(prefix, prefix + wcslen(prefix) + 1);
        if (findPathByName(directories, directories2, copy.data(), caseSensitive)) {
            parentId = directories.getFieldAsInt32(L"ID");
            missing = i;
            break;
        }
    }
    // The missing levels, outermost first.  A creation time of 0 marks a row
    // that only carries a path: it never passes the age test as a root.
    for (size_t j = missing; j > 0 && j <= names.size(); --j) {
        wchar_t const* component = names[j - 1].getPathName();
        ++directoriesIndex;
        directories.setFieldAsInt32(L"ID", directoriesIndex);
        directories.setFieldAsString(L"PATHNAME", component != nullptr ? component : L"");
        directories.setFieldAsInt32(L"PARENTID", parentId);
        directories.setFieldAsInt32(L"CREATIONTIME", 0);
        directories.insert();
        parentId = directoriesIndex;
    }

    log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - scan %S dir", className, __func__,
                  rootPath);
    std::vector<wchar_t> rootCopy(rootPath, rootPath + wcslen(rootPath) + 1);
    if (!findPathByName(directories, directories2, rootCopy.data(), caseSensitive))
        return 0;
    // Stamped before the walk: a build that times out still leaves it fresh.
    directories.setFieldAsInt32(L"CREATIONTIME", static_cast<unsigned int>(time(nullptr)));
    directories.update();

    if (!excludes.empty() && checkPathList(rootPath, excludes, caseSensitive, root.getRecursive())) {
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - path '%S' excluded!", className,
                      __func__, rootPath);
        return 0;
    }
    if (!fs_isValidPath(rootCopy.data())) {
        log->traceMID(__LINE__, __FILE__, __func__,
                      "%s::%s - '%S' is a symbolic link or is not a directory!", className, __func__,
                      rootPath);
        return 0;
    }
    // The counter's value is the root's id here: the root row was either just
    // written above or the caller removed the old tree first.
    int result = scan(query, root, directories, directoriesIndex, files,
                      static_cast<int>(directoriesIndex), includes, excludes, caseSensitive,
                      timeoutMs, logDepth);
    CpuThreshold::doIteration();
    return result;
}

int FS_CacheBase::scan(FsQuery const& query, PathDrive& path, RecordSet& directories,
                       unsigned int& directoriesIndex, RecordSet& files, int parentId,
                       std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes,
                       bool caseSensitive, int timeoutMs, int logDepth)
{
    if (timeoutMs < 1) {
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - fs scanning timed out (timeout)",
                      className, __func__);
        return 2;
    }
    wchar_t const* pathName = path.getPathName();
    if (pathName == nullptr)
        return 0;
    FsQueryStatistics& statistics = queryStatistics();
    size_t pathLength = wcslen(pathName);
    if (pathLength > SCAN_MAX_PATH) {
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - '%S' path too long", className,
                      __func__, pathName);
        statistics.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, pathName, 0);
        return 0;
    }

    // Three bytes per character and the end mark; grown, never shrunk.
    void* narrowBlock = narrowPathBuffer;
    if (!growScratch(&narrowBlock, &narrowPathBufferSize, pathLength * 3 + 1, 1)) {
        log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - out of memory for '%S'", className,
                      __func__, pathName);
        return 0;
    }
    narrowPathBuffer = static_cast<char*>(narrowBlock);
    size_t converted = wcstombs(narrowPathBuffer, pathName, narrowPathBufferSize);
    if (converted == static_cast<size_t>(-1) || converted >= narrowPathBufferSize) {
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - '%S' path can't be converted",
                      className, __func__, pathName);
        statistics.addSkipped(converted == static_cast<size_t>(-1)
                                  ? FsQueryStatistics::SKIP_UNDECODABLE_NAME
                                  : FsQueryStatistics::SKIP_PATH_TOO_LONG,
                              pathName, 0);
        return 0;
    }
    narrowPathBuffer[converted] = '\0';

    wchar_t const* fileSystem = path.getDriveFileSystem();
    if (fileSystem != nullptr && wcscmp(fileSystem, L"dfs") == 0) {
        // Only traced: whether the tree is on this machine skips nothing here.
        log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - get a path on 'dfs' filesystem",
                      className, __func__);
        FileSystemHelper helper;
        char* fset = helper.dfs_mount(narrowPathBuffer);
        log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - fset value for '%s' path is %s",
                      className, __func__, narrowPathBuffer, fset != nullptr ? fset : "NULL");
        bool isLocal = true;
        if (fset != nullptr) {
            if (dfsLocalNamesToTry) {
                if (dfsLocalNames == nullptr)
                    dfsLocalNames = new StringList<char>();
                dfsLocalNamesLoaded = helper.load_dfs_local(helper.dfs_hname(), *dfsLocalNames) == 0;
                if (dfsLocalNamesLoaded)
                    log->traceMAX(__LINE__, __FILE__, __func__,
                                  "%s::%s - load_dfs_local_retValue value is true: dfs local list loaded!",
                                  className, __func__);
                else
                    log->traceMAX(__LINE__, __FILE__, __func__,
                                  "%s::%s - load_dfs_local_retValue value is false: dfs local list not loaded!",
                                  className, __func__);
                dfsLocalNamesToTry = false;
            }
            if (!dfsLocalNamesLoaded) {
                isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
            } else if (dfsLocalNames->find(fset) >= 0) {
                isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
                log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - '%s' found in dfs local list",
                              className, __func__, fset);
            } else {
                isLocal = false;
                log->traceMAX(__LINE__, __FILE__, __func__,
                              "%s::%s - '%s' not found in dfs local list", className, __func__, fset);
            }
        }
        bool remote = path.getDriveType() == dtRemote;
        bool addRecord = (!remote && isLocal) || (remote && !isLocal);
        log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - isLocal value for '%s' path is %s",
                      className, __func__, narrowPathBuffer, isLocal ? "true" : "false");
        log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - bAddRecord value for '%s' path is %s",
                      className, __func__, narrowPathBuffer, addRecord ? "true" : "false");
    }

    if (logDepth >= 1) {
        logFolderName(folderLog, narrowPathBuffer);
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - scanning %s dir", className, __func__,
                      narrowPathBuffer);
    } else {
        log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - scanning %s dir", className, __func__,
                      narrowPathBuffer);
    }

    dirent** entries = nullptr;
    int readError = 0;
    int entryCount = fs_readDirectory(narrowPathBuffer, &entries, &readError);
    CpuThreshold::doIteration();
    if (entryCount < 0) {
        log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - scandir error opening '%s' path!",
                      className, __func__, narrowPathBuffer);
        statistics.addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, narrowPathBuffer,
                              nullptr, readError);
        // A failed read may leave the entries it kept.
        if (entries != nullptr) {
            kelm_free(entries);
        }
        return 0;
    }
    if (scanHook != nullptr)
        scanHook(narrowPathBuffer);
    // A read that broke off part way: what it read is stored as usual.
    if (readError != 0)
        statistics.addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, narrowPathBuffer,
                              nullptr, readError);
    // The recursion reuses narrowPathBuffer: skipped entries of this
    // directory are named from a copy.
    std::string directoryBytes(narrowPathBuffer);
    unsigned int start = utils::getTickCount();

    // The directory's path with one separator: room for the longest child.
    // On the heap, so that deep trees do not exhaust the thread's stack.
    std::vector<wchar_t> prefixBuffer(SCAN_MAX_PATH + 3);
    wchar_t* prefix = prefixBuffer.data();
    wmemcpy(prefix, pathName, pathLength);
    size_t prefixLength = pathLength;
    if (prefixLength == 0 || prefix[prefixLength - 1] != PathHelper::PathSeparator)
        prefix[prefixLength++] = PathHelper::PathSeparator;
    prefix[prefixLength] = L'\0';

    bool included = includes.empty() || checkPathList(pathName, includes, caseSensitive, false);
    bool excluded = !excludes.empty() && checkPathList(pathName, excludes, caseSensitive, false);
    bool recursive = path.getRecursive();

    int result = 0;
    int i = entryCount - 1;
    for (; i >= 0; --i) {
        dirent* entry = entries[i];
        char const* entryName = entry->d_name;
        size_t entryBytes = strlen(entryName);

        FsFileInfo info;
        prefix[prefixLength] = L'\0';
        info.setFilePath(prefix);
        void* wideBlock = wideNameBuffer;
        size_t nameLength = 0;
        bool reserved = growScratch(&wideBlock, &wideNameBufferSize, entryBytes + 1, sizeof(wchar_t));
        if (reserved) {
            wideNameBuffer = static_cast<wchar_t*>(wideBlock);
            size_t n = mbstowcs(wideNameBuffer, entryName, wideNameBufferSize);
            if (n == static_cast<size_t>(-1) || n >= wideNameBufferSize)
                n = 0;
            wideNameBuffer[n] = L'\0';
            nameLength = n;
        }
        if (nameLength == 0) {
            log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - file name len is 0. file skipped!",
                          className, __func__);
            if (reserved)
                statistics.addSkipped(FsQueryStatistics::SKIP_UNDECODABLE_NAME,
                                      directoryBytes.c_str(), entryName, 0);
            kelm_free(entry);
            continue;
        }
        info.setFileName(wideNameBuffer);
        bool known = info.updateInfo();  // a failed status call leaves attr 0: a file
        unsigned int attr = info.getAttr();
        // An entry without status is stored as a file, and nothing below it is
        // read: past the system's 4095 bytes, or refused (a directory that may
        // be listed but not searched), or gone since the listing.  "." and
        // ".." are no entries of their own.
        bool dotName = wcscmp(wideNameBuffer, L".") == 0 || wcscmp(wideNameBuffer, L"..") == 0;
        if (!known && !dotName) {
            if (prefixLength + nameLength > SCAN_MAX_PATH ||
                directoryBytes.size() + 1 + entryBytes > SCAN_MAX_PATH)
                statistics.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(),
                                      entryName, 0);
            else
                statistics.addSkipped(FsQueryStatistics::SKIP_NO_STATUS, directoryBytes.c_str(),
                                      entryName, statusError(directoryBytes, entryName));
        }

        if ((attr & FsFileInfo::ATTR_DIRECTORY) == 0) {
            if (included && !excluded) {
                statistics.addFile();
                ++filesScanned;
                if (filesScanned % CpuThreshold::CPU_THROTTLE_NO_OF_SCANNED_FILES_FACTOR == 0)
                    CpuThreshold::doIteration();
            }
            if (isFileToBeCached(query, wideNameBuffer)) {
                files.setFieldAsString(L"FILENAME", wideNameBuffer);
                files.setFieldAsInt64(L"SIZE", info.getSize());
                files.setFieldAsInt32(L"ATTR", attr);
                files.setFieldAsInt32(L"PATHID", static_cast<unsigned int>(parentId));
                if (!computeChecksums) {
                    files.setFieldAsString(L"MD5", L"0");
                    files.setFieldAsInt32(L"CRC32", 0);
                    files.setFieldAsInt32(L"Q32", 0);
                } else {
                    FileChecksumInfo sums;
                    sums.flags = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5;
                    // Only a regular file is opened: a link, a pipe or a
                    // device keeps zero sums.
                    if ((attr & FsFileInfo::ATTR_REGULAR) != 0) {
                        std::vector<char> narrowFile(SCAN_NARROW_PATH_BYTES);
                        if (narrowFilePath(prefix, wideNameBuffer, narrowFile.data()))
                            computeRegularFileChecksumInfo(sums, narrowFile.data());
                    }
                    wchar_t md5Text[MD5_TEXT_SIZE];
                    md52wchar_t(sums.md5, md5Text);
                    files.setFieldAsString(L"MD5", md5Text);
                    files.setFieldAsInt32(L"CRC32", sums.crc32);
                    files.setFieldAsInt32(L"Q32", sums.q32);
                }
                files.insert();
            }
            kelm_free(entry);
            continue;
        }

        bool dot = wcscmp(wideNameBuffer, L".") == 0 || wcscmp(wideNameBuffer, L"..") == 0;
        if (dot || (attr & FsFileInfo::ATTR_SYMLINK) != 0 || !recursive) {
            kelm_free(entry);
            continue;
        }
        if (prefixLength + nameLength > SCAN_MAX_PATH) {
            log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - '%S' path too long!", className,
                          __func__, wideNameBuffer);
            statistics.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(),
                                  entryName, 0);
            kelm_free(entry);
            continue;
        }
        wmemcpy(prefix + prefixLength, wideNameBuffer, nameLength + 1);
        if (!excludes.empty() && checkPathList(prefix, excludes, caseSensitive, true)) {
            log->traceMID(__LINE__, __FILE__, __func__, "%s::%s - path '%S' excluded!", className,
                          __func__, prefix);
            kelm_free(entry);
            continue;
        }
        // Written even when this directory's own files were not counted.
        ++directoriesIndex;
        directories.setFieldAsInt32(L"ID", directoriesIndex);
        directories.setFieldAsString(L"PATHNAME", wideNameBuffer);
        directories.setFieldAsInt32(L"PARENTID", static_cast<unsigned int>(parentId));
        directories.setFieldAsInt32(L"CREATIONTIME", static_cast<unsigned int>(time(nullptr)));
        directories.insert();

        PathDrive child(prefix, recursive, static_cast<DriveInfo const&>(path));
        statistics.addDirectory();
        ++directoriesScanned;
        kelm_free(entry);
        int remaining = timeoutMs - static_cast<int>(utils::getTickCount() - start);
        int childResult = scan(query, child, directories, directoriesIndex, files,
                               static_cast<int>(directoriesIndex), includes, excludes,
                               caseSensitive, remaining, std::max(logDepth - 1, 0));
        if (childResult != 0) {
            result = childResult;
            break;
        }
    }
    // After a stop the entries not visited yet are released too.
    for (int j = i - 1; j >= 0; --j)
        kelm_free(entries[j]);
    kelm_free(entries);
    log->traceMAX(__LINE__, __FILE__, __func__, "%s::%s - exit. [retValue is %d] [deep %d]",
                  className, __func__, result, logDepth);
    return result;
}
