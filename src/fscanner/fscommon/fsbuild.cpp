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
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/walk.h"
#include "fscanner/fscommon/wildcard.h"

// The walk reads directories and file status with large-file support: without
// it the 32-bit C library fails readdir and lstat with EOVERFLOW on 64-bit
// inode numbers, directory offsets and sizes of 2 GiB or more, and whole
// directories would drop out of every answer.
static_assert(sizeof(off_t) == 8 && sizeof(ino_t) == 8, "the library is built with _FILE_OFFSET_BITS=64");

namespace {

using fscanner::DirectoryWalker;
using fscanner::WalkDirectory;
using fscanner::WalkEntry;
using fscanner::WalkSkip;
using fscanner::WalkVisit;

// Process-wide state of the direct walk.  Never released but at exit; one
// walk at a time (see the header).  The conversion block's size carries from
// walk to walk: it decides whether a path whose multibyte form is longer than
// 3 bytes per character still converts.
char* narrowPath = nullptr;      // directory being opened
size_t narrowPathCapacity = 0;   // bytes
fscanner::DfsLocalList dfsLocalList;

const fscanner::DfsTraceStyle kDfsTraces = {"::fs_scan - ", "FS_Cache::scan - ", "\n", "dfsAddRecord"};

// The direct walk's receiver: offers every file of an included, not excluded
// directory to the criteria stage and writes the hits.  Excludes act on every
// entry before its status; "." and ".." and names past the path limit are
// passed over before it too.
class DirectScanSink : public fscanner::WalkSink {
public:
    DirectScanSink(FsResultSetWriter& writer, FileProcessor& processor, std::vector<PathInfo>& includes,
                   std::vector<PathInfo>& excludes, bool caseSensitive, FsQueryStatistics* statistics)
        : writer_(writer),
          processor_(processor),
          includes_(includes),
          excludes_(excludes),
          caseSensitive_(caseSensitive),
          statistics_(statistics),
          log_(getQvLogFs()) {}

    void skipDirectory(const WalkDirectory& directory, WalkSkip why, int error) override {
        const wchar_t* path = directory.pathName;
        switch (why) {
            case WalkSkip::TimedOut:
                log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - fs scanning timed out (timeout)\n");
                break;
            case WalkSkip::PathTooLong:
                log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - '%S' path too long\n", path);
                if (statistics_ != nullptr) statistics_->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, path, 0);
                break;
            case WalkSkip::NotConvertible:
            case WalkSkip::ConvertedTooLong:
                log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - '%S' path can't be converted\n", path);
                if (statistics_ != nullptr) {
                    statistics_->addSkipped(why == WalkSkip::NotConvertible ? FsQueryStatistics::SKIP_UNDECODABLE_NAME
                                                                            : FsQueryStatistics::SKIP_PATH_TOO_LONG,
                                            path, 0);
                }
                break;
            case WalkSkip::Unreadable:
                log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - scandir error opening '%s' path!\n",
                               directory.narrowPath->c_str());
                if (statistics_ != nullptr) {
                    statistics_->addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY,
                                            directory.narrowPath->c_str(), nullptr, error);
                }
                break;
            default:  // OutOfMemory: given up without a word
                break;
        }
    }

    void enterDirectory(const WalkDirectory& directory) override {
        Level& level = levelOf(directory);
        level.checksums = FileChecksumInfo();  // valid false, flags 0
        level.onDfs = false;
        level.dfsAdd = false;
        const wchar_t* fileSystem = directory.path->getDriveFileSystem();
        if (fileSystem != nullptr && wcscmp(fileSystem, L"dfs") == 0) {
            level.onDfs = true;
            level.dfsAdd = fscanner::dfsDecision(log_, kDfsTraces, dfsLocalList, directory.narrowPath->c_str(),
                                                 directory.path->getDriveType());
        }
    }

    void directoryListed(const WalkDirectory& directory) override {
        Level& level = levelOf(directory);
        if (statistics_ != nullptr && directory.readError != 0) {
            statistics_->addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, directory.narrowPath->c_str(),
                                    nullptr, directory.readError);
        }
        // Made once per directory, on the path as given; they govern files only.
        level.included = includes_.empty() || checkPathList(directory.pathName, includes_, caseSensitive_, false);
        level.excluded = !excludes_.empty() && checkPathList(directory.pathName, excludes_, caseSensitive_, false);
    }

    void skipEntry(const WalkDirectory& directory, const WalkEntry& entry, WalkSkip why) override {
        if (why == WalkSkip::Undecodable) {
            log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - file name len is 0. file skipped!\n");
            if (statistics_ != nullptr) {
                statistics_->addSkipped(FsQueryStatistics::SKIP_UNDECODABLE_NAME, directory.narrowPath->c_str(),
                                        entry.name, 0);
            }
        } else if (why == WalkSkip::PathTooLong && statistics_ != nullptr) {
            statistics_->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directory.narrowPath->c_str(), entry.name,
                                    0);
        }
    }

    WalkVisit visitEntry(const WalkDirectory& directory, const WalkEntry& entry, FsFileInfo& info,
                         bool known) override {
        Level& level = levelOf(directory);
        WalkVisit visit;
        unsigned int attr = info.getAttr();  // a failed status leaves attr 0: the entry is then a file
        // An entry without status goes on as a file, and nothing below it is
        // read: past the system's 4095 bytes, or refused (a directory that
        // may be listed but not searched), or gone since the listing.
        if (!known && statistics_ != nullptr) {
            const std::string& directoryBytes = *directory.narrowPath;
            if (directoryBytes.size() + 1 + entry.nameBytes > DirectoryWalker::kMaxPath) {
                statistics_->addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(), entry.name, 0);
            } else {
                statistics_->addSkipped(FsQueryStatistics::SKIP_NO_STATUS, directoryBytes.c_str(), entry.name,
                                        fscanner::statusErrorOf(directoryBytes, entry.name));
            }
        }

        if (attr & FsFileInfo::ATTR_DIRECTORY) {
            if ((attr & FsFileInfo::ATTR_SYMLINK) == 0 && directory.path->getRecursive()) {
                if (!excludes_.empty() && checkPathList(entry.fullPath, excludes_, caseSensitive_, true)) {
                    log_->traceMID(__LINE__, __FILE__, "fs_scan", "::fs_scan - path '%S' excluded!\n", entry.fullPath);
                } else {
                    if (statistics_ != nullptr) statistics_->addDirectory();
                    visit.descend = true;
                }
            }
            return visit;
        }
        if (!level.included || level.excluded) return visit;

        if (statistics_ != nullptr) statistics_->addFile();
        FileChecksumInfo& checksums = level.checksums;
        unsigned int wanted = processor_.processingFlags;
        if (wanted & (FileProcessor::PROCESS_MD5 | FileProcessor::PROCESS_CRC32 | FileProcessor::PROCESS_Q32)) {
            if (wanted & FileProcessor::PROCESS_CRC32) checksums.flags |= FILE_CHECKSUM_CRC32;
            if (wanted & FileProcessor::PROCESS_Q32) checksums.flags |= FILE_CHECKSUM_Q32;
            if (wanted & FileProcessor::PROCESS_MD5) checksums.flags |= FILE_CHECKSUM_MD5;
            // Only a regular file's content is read.  A link, a pipe or a
            // device is not opened (a pipe would block, a device may never
            // end): the sums then still hold what the previous file of this
            // directory left in them.
            if ((attr & FsFileInfo::ATTR_REGULAR) != 0) {
                std::vector<char> narrowFile(fscanner::kNarrowFilePathBytes);
                if (fscanner::narrowFilePath(info.getPath(), info.getName(), narrowFile.data())) {
                    computeRegularFileChecksumInfo(checksums, narrowFile.data());
                }
            }
        }
        if (processor_.satisfyCriteria(info, checksums, nullptr) && (!level.onDfs || level.dfsAdd)) {
            writer_.addRecord(info);
            if (statistics_ != nullptr) statistics_->addHit();
        }
        return visit;
    }

    void leaveDirectory(const WalkDirectory&, int) override {}

private:
    // What one directory of the walk keeps while its entries are visited.
    struct Level {
        bool included = false;
        bool excluded = false;
        bool onDfs = false;
        bool dfsAdd = false;
        FileChecksumInfo checksums;  // one per visit, carried from file to file
    };
    Level& levelOf(const WalkDirectory& directory) {
        size_t depth = static_cast<size_t>(directory.depth);
        if (levels_.size() <= depth) levels_.resize(depth + 1);
        return levels_[depth];
    }

    FsResultSetWriter& writer_;
    FileProcessor& processor_;
    std::vector<PathInfo>& includes_;
    std::vector<PathInfo>& excludes_;
    bool caseSensitive_;
    FsQueryStatistics* statistics_;
    QvLogWrapper* log_;
    std::vector<Level> levels_;
};

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
    if (fscanner::Env::Current()->linkStatus(narrow, &status) != 0) {
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
    fscanner::Env* env = fscanner::Env::Current();
    DIR* dir = env->openDirectory(path);
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
        struct dirent* entry = env->readDirectory(dir);
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
            env->closeDirectory(dir);
            *error = ENOMEM;
            return -1;
        }
        *namelist = grown;
        dirent* copy = static_cast<dirent*>(kelm_malloc(entry->d_reclen));
        if (copy == nullptr) {
            log->traceMAX(__LINE__, __FILE__, "scandir", "::scandir - (*namelist)[i] == NULL!\n");
            env->closeDirectory(dir);
            *error = ENOMEM;
            return -1;
        }
        std::memcpy(copy, entry, entry->d_reclen);
        (*namelist)[count] = copy;
        ++count;
    }
    errno = 0;
    if (env->closeDirectory(dir) != 0 || count == 0) {
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
    DirectScanSink sink(writer, processor, includes, excludes, caseSensitive, statistics);
    fscanner::WalkOptions options;
    options.conversion = {&narrowPath, &narrowPathCapacity};
    options.dotsBeforeStatus = true;
    options.lengthBeforeStatus = true;
    options.entryExcludes = &excludes;
    options.caseSensitive = caseSensitive;
    DirectoryWalker walker(sink, options);
    return walker.walk(pathDrive, timeoutMs, 0);
}
