#include "fscanner/fscommon/fsbuild.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

// The walk reads directories and file status with large-file support: without
// it the 32-bit C library fails readdir and lstat with EOVERFLOW on 64-bit
// inode numbers, directory offsets and sizes of 2 GiB or more, and whole
// directories would drop out of every answer.
static_assert(sizeof(off_t) == 8 && sizeof(ino_t) == 8, "the library is built with _FILE_OFFSET_BITS=64");

namespace {

// Longest path the walk accepts, in wide characters.
const size_t kMaxPath = 4095;
// Narrow buffer of the checksum paths, in bytes.
const size_t kNarrowPathBytes = 4096;

// Process-wide state of the walk.  Never released but at exit; one walk at a
// time (see the header).
char* narrowPath = nullptr;      // directory being opened
size_t narrowPathCapacity = 0;   // bytes
wchar_t* wideName = nullptr;     // entry name being converted
size_t wideNameCapacity = 0;     // characters
StringList<char>* dfsLocalList = nullptr;
bool dfsLocalListLoaded = false;
bool dfsLocalListPending = true;  // the list has not been tried yet

// Makes the narrow buffer hold at least bytes; a new buffer is zeroed.  The
// buffer never shrinks.
bool reserveNarrow(size_t bytes) {
    if (narrowPathCapacity >= bytes) return true;
    char* fresh = static_cast<char*>(kelm_malloc(bytes));
    if (fresh == nullptr) return false;
    std::memset(fresh, 0, bytes);
    kelm_free(narrowPath);
    narrowPath = fresh;
    narrowPathCapacity = bytes;
    return true;
}

bool reserveWide(size_t characters) {
    if (wideNameCapacity >= characters) return true;
    wchar_t* fresh = static_cast<wchar_t*>(kelm_malloc(characters * sizeof(wchar_t)));
    if (fresh == nullptr) return false;
    wmemset(fresh, 0, characters);
    kelm_free(wideName);
    wideName = fresh;
    wideNameCapacity = characters;
    return true;
}

// Narrow full path of a file for the checksum pass: path and name each through
// wcstombs, within kNarrowPathBytes.  False when either does not convert or
// the result does not fit.
bool narrowFullPath(const wchar_t* path, const wchar_t* name, char* out) {
    if (path == nullptr || name == nullptr) return false;
    size_t used = wcstombs(out, path, kNarrowPathBytes);
    if (used == static_cast<size_t>(-1) || used >= kNarrowPathBytes) return false;
    size_t more = wcstombs(out + used, name, kNarrowPathBytes - used);
    if (more == static_cast<size_t>(-1) || used + more >= kNarrowPathBytes) return false;
    return true;
}

// Why the status of directory/name cannot be read, for the statistics: the
// status call is made again, as the first one's errno may be gone.  0 when it
// now succeeds.
int statusError(const std::string& directory, const char* name) {
    std::string path = directory;
    if (path.empty() || path.back() != '/') path += '/';
    path += name;
    struct stat status;
    return lstat(path.c_str(), &status) == 0 ? 0 : errno;
}

// Decides, for one directory of a "dfs" tree, whether its files are recorded.
bool dfsAddRecord(QvLogWrapper* log, const char* narrow, DriveType driveType) {
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - get a path on 'dfs' filesystem\n");
    FileSystemHelper helper;
    char* fset = helper.dfs_mount(narrow);
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - fset value for '%s' path is %s\n",
                  narrow, fset != nullptr ? fset : "NULL");
    bool isLocal = true;
    if (fset != nullptr) {
        if (dfsLocalList == nullptr) dfsLocalList = new StringList<char>();
        if (dfsLocalListPending) {
            dfsLocalListLoaded = helper.load_dfs_local(helper.dfs_hname(), *dfsLocalList) == 0;
            if (dfsLocalListLoaded) {
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                              "FS_Cache::scan - load_dfs_local_retValue value is true: dfs local list loaded!\n");
            } else {
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                              "FS_Cache::scan - load_dfs_local_retValue value is false: dfs local list not loaded!\n");
            }
            dfsLocalListPending = false;
        }
        // Without the list every file set is asked about on its own; with it,
        // only a file set found in the list is asked.
        if (!dfsLocalListLoaded) {
            isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
        } else {
            if (dfsLocalList->find(fset) >= 0) {
                isLocal = helper.dfs_local(fset, helper.dfs_hname()) != 0;
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                              "::fs_scan - '%s' found in dfs local list\n", fset);
            } else {
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                              "::fs_scan - '%s' not found in dfs local list\n", fset);
                isLocal = false;
            }
        }
    }
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - isLocal value for '%s' path is %s\n",
                  narrow, isLocal ? "true" : "false");
    bool remote = driveType == dtRemote;
    bool addRecord = (!remote && isLocal) || (remote && !isLocal);
    log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - bAddRecord value for '%s' path is %s\n",
                  narrow, addRecord ? "true" : "false");
    return addRecord;
}

}  // namespace

// --------------------------------------------------------- FileSystemHelper

namespace {
FileSystemHelper::Backend* dfsBackend = nullptr;
}

void FileSystemHelper::setBackend(Backend* backend) { dfsBackend = backend; }

char* FileSystemHelper::dfs_mount(const char* path) {
    return dfsBackend != nullptr ? dfsBackend->dfs_mount(path) : nullptr;
}

char* FileSystemHelper::dfs_hname() { return dfsBackend != nullptr ? dfsBackend->dfs_hname() : nullptr; }

int FileSystemHelper::load_dfs_local(char* host, StringList<char>& list) {
    return dfsBackend != nullptr ? dfsBackend->load_dfs_local(host, list) : 0;
}

int FileSystemHelper::dfs_local(const char* fileSet, const char* host) {
    return dfsBackend != nullptr ? dfsBackend->dfs_local(fileSet, host) : 0;
}

// -------------------------------------------------------------------- walks

bool fs_isValidPath(wchar_t* path) {
    QvLogWrapper* log = getQvLogFs();
    if (path == nullptr) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "fs_isValidPath - path name specified is null\n");
        return false;
    }
    char* narrow = utils::myWcsToMbsString(path);
    if (narrow == nullptr || narrow[0] == 0) {
        delete[] narrow;
        return false;
    }
    struct stat status;
    if (lstat(narrow, &status) != 0) {
        unsigned int error = static_cast<unsigned int>(errno);
        log->traceMIN(__LINE__, __FILE__, __FUNCTION__,
                      "fs_isValidPath - lstat error opening '%S' path, errno: %u", path, error);
        delete[] narrow;
        return false;
    }
    delete[] narrow;
    return S_ISDIR(status.st_mode);
}

int scandir(const char* path, dirent*** namelist) { return fs_readDirectory(path, namelist, nullptr); }

int fs_readDirectory(const char* path, dirent*** namelist, int* error) {
    QvLogWrapper* log = getQvLogFs();
    int ignored = 0;
    if (error == nullptr) error = &ignored;
    *error = 0;
    if (path == nullptr || namelist == nullptr) return -1;
    *namelist = nullptr;
    DIR* dir = opendir(path);
    if (dir == nullptr) {
        *error = errno;
        log->traceMIN(__LINE__, __FILE__, "scandir", "::scandir CAN'T OPEN %s dir, errno: %u ('%s')",
                      path, static_cast<unsigned int>(*error), strerror(*error));
        return -1;
    }
    int count = 0;
    for (;;) {
        // readdir gives null at the end and on an error; only errno tells.
        errno = 0;
        struct dirent* entry = readdir(dir);
        if (entry == nullptr) {
            *error = errno;
            break;
        }
        dirent** grown = static_cast<dirent**>(
            kelm_realloc(*namelist, static_cast<size_t>(count + 1) * sizeof(dirent*)));
        if (grown == nullptr) {
            log->traceMAX(__LINE__, __FILE__, "scandir", "::scandir - *namelist == NULL!\n");
            // The entries read so far stay in *namelist; the handle is closed
            // so that a failing walk does not also leak descriptors.
            closedir(dir);
            *error = ENOMEM;
            return -1;
        }
        *namelist = grown;
        dirent* copy = static_cast<dirent*>(kelm_malloc(entry->d_reclen));
        if (copy == nullptr) {
            log->traceMAX(__LINE__, __FILE__, "scandir", "::scandir - (*namelist)[i] == NULL!\n");
            closedir(dir);
            *error = ENOMEM;
            return -1;
        }
        std::memcpy(copy, entry, entry->d_reclen);
        (*namelist)[count] = copy;
        ++count;
    }
    errno = 0;
    if (closedir(dir) != 0 || count == 0) {
        if (*error == 0) *error = errno;
        for (int i = 0; i < count; ++i) kelm_free((*namelist)[i]);
        kelm_free(*namelist);
        *namelist = nullptr;
        return -1;
    }
    return count;
}

int fs_build(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& root,
             std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
             int timeoutMs) {
    return fs_build(writer, processor, root, includes, excludes, caseSensitive, timeoutMs, nullptr);
}

int fs_build(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& root,
             std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
             int timeoutMs, FsQueryStatistics* statistics) {
    QvLogWrapper* log = getQvLogFs();
    wchar_t* rootPath = root.getPathName();
    if (!excludes.empty() && checkPathList(rootPath, excludes, caseSensitive, root.getRecursive())) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_build - path '%S' excluded!\n", rootPath);
        return FS_SCAN_DONE;
    }
    if (!fs_isValidPath(rootPath)) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__,
                      "::fs_build - '%S' is a symbolic link or is not a directory!\n",
                      rootPath != nullptr ? rootPath : L"");
        return FS_SCAN_DONE;
    }
    return fs_scan(writer, processor, root, includes, excludes, caseSensitive, timeoutMs, statistics);
}

int fs_scan(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& pathDrive,
            std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
            int timeoutMs) {
    return fs_scan(writer, processor, pathDrive, includes, excludes, caseSensitive, timeoutMs, nullptr);
}

int fs_scan(FsResultSetWriter& writer, FileProcessor& processor, PathDrive& pathDrive,
            std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, bool caseSensitive,
            int timeoutMs, FsQueryStatistics* statistics) {
    QvLogWrapper* log = getQvLogFs();
    PathInfo pathInfo(pathDrive);
    FileChecksumInfo checksums;
    checksums.valid = false;
    checksums.flags = 0;

    if (timeoutMs < 1) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - fs scanning timed out (timeout)\n");
        return FS_SCAN_TIMED_OUT;
    }
    const wchar_t* path = pathInfo.getPathName();
    if (path == nullptr) return FS_SCAN_DONE;
    size_t pathLength = wcslen(path);
    if (pathLength > kMaxPath) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - '%S' path too long\n", path);
        if (statistics != nullptr) statistics->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, path, 0);
        return FS_SCAN_DONE;
    }

    // The factor 3 bytes per character is fixed; a path whose multibyte form
    // is longer does not fit and is given up like an unreadable directory.
    if (!reserveNarrow(pathLength * 3 + 1)) return FS_SCAN_DONE;
    size_t converted = wcstombs(narrowPath, path, narrowPathCapacity);
    if (converted == static_cast<size_t>(-1) || converted >= narrowPathCapacity) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - '%S' path can't be converted\n", path);
        if (statistics != nullptr) {
            statistics->addSkipped(converted == static_cast<size_t>(-1) ? FsQueryStatistics::SKIP_UNDECODABLE_NAME
                                                                       : FsQueryStatistics::SKIP_PATH_TOO_LONG,
                                   path, 0);
        }
        return FS_SCAN_DONE;
    }

    bool onDfs = false;
    bool dfsAdd = false;
    const wchar_t* fileSystem = pathDrive.getDriveFileSystem();
    if (fileSystem != nullptr && wcscmp(fileSystem, L"dfs") == 0) {
        onDfs = true;
        dfsAdd = dfsAddRecord(log, narrowPath, pathDrive.getDriveType());
    }

    size_t includeCount = includes.size();
    size_t excludeCount = excludes.size();
    dirent** entries = nullptr;
    int readError = 0;
    int entryCount = fs_readDirectory(narrowPath, &entries, &readError);
    if (entryCount < 0) {
        log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - scandir error opening '%s' path!\n",
                      narrowPath);
        if (statistics != nullptr) {
            statistics->addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, narrowPath, nullptr, readError);
        }
        return FS_SCAN_DONE;
    }
    // The shared narrow buffer is reused by the recursion: skipped entries
    // of this directory are named from a copy.
    std::string directoryBytes;
    if (statistics != nullptr) {
        directoryBytes = narrowPath;
        if (readError != 0) {
            statistics->addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, narrowPath, nullptr, readError);
        }
    }
    unsigned int start = getTickCount();

    // Room for a 4095-character path, its added separator and the end mark.
    // On the heap: a chain of one-character directories is 2000 levels deep,
    // and 16 KB of stack per level would overflow the thread's stack.
    std::vector<wchar_t> workBuffer(kMaxPath + 3);
    wchar_t* work = workBuffer.data();
    wmemcpy(work, path, pathLength);
    size_t dirLength = pathLength;
    if (dirLength == 0 || work[dirLength - 1] != PathHelper::PathSeparator) {
        work[dirLength++] = PathHelper::PathSeparator;
    }
    work[dirLength] = 0;

    // Made once per directory, on the path as given; they govern files only.
    bool dirIncluded = includeCount == 0 || checkPathList(path, includes, caseSensitive, false);
    bool dirExcluded = excludeCount != 0 && checkPathList(path, excludes, caseSensitive, false);
    bool recursive = pathInfo.getRecursive();

    int result = FS_SCAN_DONE;
    int i = entryCount - 1;
    for (; i >= 0; --i) {
        dirent* entry = entries[i];
        const char* entryName = entry->d_name;
        size_t entryBytes = std::strlen(entryName);
        size_t nameLength = 0;
        bool reserved = reserveWide(entryBytes + 1);
        bool converted = reserved;
        if (converted) {
            size_t n = mbstowcs(wideName, entryName, wideNameCapacity);
            converted = n != static_cast<size_t>(-1) && n > 0 && n < wideNameCapacity;
            if (converted) nameLength = n;
        }
        if (!converted) {
            log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - file name len is 0. file skipped!\n");
            if (statistics != nullptr && reserved) {
                statistics->addSkipped(FsQueryStatistics::SKIP_UNDECODABLE_NAME, directoryBytes.c_str(),
                                       entryName, 0);
            }
            kelm_free(entry);
            continue;
        }
        if (wcscmp(wideName, L".") == 0 || wcscmp(wideName, L"..") == 0) {
            kelm_free(entry);
            continue;
        }
        if (nameLength + dirLength > kMaxPath) {
            if (statistics != nullptr) {
                statistics->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(), entryName, 0);
            }
            kelm_free(entry);
            continue;
        }

        FsFileInfo info;
        work[dirLength] = 0;
        info.setFilePath(work);
        wmemcpy(work + dirLength, wideName, nameLength + 1);

        if (!excludes.empty() && checkPathList(work, excludes, caseSensitive, true)) {
            kelm_free(entry);
            continue;
        }

        info.setFileName(wideName);
        bool known = info.updateInfo();  // a failure leaves attr 0: the entry is then a file
        unsigned int attr = info.getAttr();
        // An entry without status goes on as a file, and nothing below it is
        // read: past the system's 4095 bytes, or refused (a directory that
        // may be listed but not searched), or gone since the listing.
        if (!known && statistics != nullptr) {
            if (directoryBytes.size() + 1 + entryBytes > kMaxPath) {
                statistics->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(), entryName, 0);
            } else {
                statistics->addSkipped(FsQueryStatistics::SKIP_NO_STATUS, directoryBytes.c_str(), entryName,
                                       statusError(directoryBytes, entryName));
            }
        }

        int subResult = FS_SCAN_DONE;
        if (attr & FsFileInfo::ATTR_DIRECTORY) {
            if ((attr & FsFileInfo::ATTR_SYMLINK) == 0 && recursive) {
                if (!excludes.empty() && checkPathList(work, excludes, caseSensitive, true)) {
                    log->traceMID(__LINE__, __FILE__, __FUNCTION__, "::fs_scan - path '%S' excluded!\n",
                                  work);
                } else {
                    PathDrive child(work, recursive, static_cast<const DriveInfo&>(pathDrive));
                    if (statistics != nullptr) statistics->addDirectory();
                    int remaining = timeoutMs - static_cast<int>(getTickCount() - start);
                    subResult = fs_scan(writer, processor, child, includes, excludes, caseSensitive,
                                        remaining, statistics);
                }
            }
        } else if (dirIncluded && !dirExcluded) {
            if (statistics != nullptr) statistics->addFile();
            unsigned int wanted = processor.processingFlags;
            if (wanted & (FileProcessor::PROCESS_MD5 | FileProcessor::PROCESS_CRC32 |
                          FileProcessor::PROCESS_Q32)) {
                if (wanted & FileProcessor::PROCESS_CRC32) checksums.flags |= FILE_CHECKSUM_CRC32;
                if (wanted & FileProcessor::PROCESS_Q32) checksums.flags |= FILE_CHECKSUM_Q32;
                if (wanted & FileProcessor::PROCESS_MD5) checksums.flags |= FILE_CHECKSUM_MD5;
                // Only a regular file's content is read.  A link, a pipe or a
                // device is not opened (a pipe would block, a device may never
                // end): the sums then still hold what the previous file of
                // this directory left in them.
                if ((attr & FsFileInfo::ATTR_REGULAR) != 0) {
                    std::vector<char> narrowFile(kNarrowPathBytes);
                    if (narrowFullPath(info.getPath(), info.getName(), narrowFile.data())) {
                        computeRegularFileChecksumInfo(checksums, narrowFile.data());
                    }
                }
            }
            if (processor.satisfyCriteria(info, checksums, nullptr) && (!onDfs || dfsAdd)) {
                writer.addRecord(info);
                if (statistics != nullptr) statistics->addHit();
            }
        }
        kelm_free(entry);
        if (subResult != FS_SCAN_DONE) {
            result = subResult;
            break;
        }
    }
    // After a stop the entries not visited yet are released here too.
    for (int j = i - 1; j >= 0; --j) kelm_free(entries[j]);
    kelm_free(entries);
    return result;
}
