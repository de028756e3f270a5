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
#include "fscanner/fscommon/trace.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/walk.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

using fscanner::DirectoryWalker;
using fscanner::WalkDirectory;
using fscanner::WalkEntry;
using fscanner::WalkSkip;
using fscanner::WalkVisit;

// Local file sets of the distributed file system, shared by every cache
// object of the process and loaded at most once.  Unguarded, as the scan of
// one object is single-threaded and the list is only read after loading.
fscanner::DfsLocalList dfsLocalNames;

// The cache walk's receiver: one directory row per directory it descends
// into, one file row per cacheable file, whatever the includes say; only
// files of included, not excluded directories are counted.  Every entry gets
// its status, "." and ".." too (they are directories and pass over), and
// recursive excludes act on directories only, after it.
class CacheScanSink : public fscanner::WalkSink {
public:
    CacheScanSink(FS_CacheBase& cache, FsQuery const& query, RecordSet& directories,
                  unsigned int& directoriesIndex, RecordSet& files, std::vector<PathInfo>& includes,
                  std::vector<PathInfo>& excludes, bool caseSensitive, int logDepth,
                  FsQueryStatistics& statistics)
        : cache_(cache), query_(query), directories_(directories),
          directoriesIndex_(directoriesIndex), files_(files), includes_(includes),
          excludes_(excludes), caseSensitive_(caseSensitive), logDepth_(logDepth),
          statistics_(statistics), log_(cache.log), className_(cache.className),
          dfsPrefix_(std::string(cache.className) + "::scan - ")
    {
        dfsTraces_ = {dfsPrefix_.c_str(), dfsPrefix_.c_str(), "", "scan"};
    }

    void skipDirectory(WalkDirectory const& directory, WalkSkip why, int error) override
    {
        wchar_t const* pathName = directory.pathName;
        switch (why) {
        case WalkSkip::TimedOut:
            FS_TRACE_FOR(log_, MID, className_, "scan", "fs scanning timed out (timeout)");
            break;
        case WalkSkip::PathTooLong:
            FS_TRACE_FOR(log_, MID, className_, "scan", "'%S' path too long", pathName);
            statistics_.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, pathName, 0);
            break;
        case WalkSkip::OutOfMemory:
            FS_TRACE_FOR(log_, MIN, className_, "scan", "out of memory for '%S'", pathName);
            break;
        case WalkSkip::NotConvertible:
        case WalkSkip::ConvertedTooLong:
            FS_TRACE_FOR(log_, MID, className_, "scan", "'%S' path can't be converted", pathName);
            statistics_.addSkipped(why == WalkSkip::NotConvertible
                                       ? FsQueryStatistics::SKIP_UNDECODABLE_NAME
                                       : FsQueryStatistics::SKIP_PATH_TOO_LONG,
                                   pathName, 0);
            break;
        case WalkSkip::Unreadable:
            // The throttle counts every attempt to read a directory.
            CpuThreshold::doIteration();
            FS_TRACE_FOR(log_, MID, className_, "scan", "scandir error opening '%s' path!",
                         directory.narrowPath->c_str());
            statistics_.addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY,
                                   directory.narrowPath->c_str(), nullptr, error);
            break;
        default:
            break;
        }
    }

    void enterDirectory(WalkDirectory const& directory) override
    {
        char const* narrow = directory.narrowPath->c_str();
        wchar_t const* fileSystem = directory.path->getDriveFileSystem();
        if (fileSystem != nullptr && wcscmp(fileSystem, L"dfs") == 0) {
            // Only traced: whether the tree is on this machine skips nothing here.
            fscanner::dfsDecision(log_, dfsTraces_, dfsLocalNames, narrow,
                                  directory.path->getDriveType());
        }
        if (logDepthOf(directory) >= 1) {
            logFolderName(cache_.folderLog, narrow);
            FS_TRACE_FOR(log_, MID, className_, "scan", "scanning %s dir", narrow);
        } else {
            FS_TRACE_FOR(log_, MAX, className_, "scan", "scanning %s dir", narrow);
        }
    }

    void directoryListed(WalkDirectory const& directory) override
    {
        CpuThreshold::doIteration();
        if (FS_CacheBase::scanHook != nullptr)
            FS_CacheBase::scanHook(directory.narrowPath->c_str());
        // A read that broke off part way: what it read is stored as usual.
        if (directory.readError != 0)
            statistics_.addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY,
                                   directory.narrowPath->c_str(), nullptr, directory.readError);
        Level& level = levelOf(directory);
        level.included = includes_.empty() ||
                         checkPathList(directory.pathName, includes_, caseSensitive_, false);
        level.excluded = !excludes_.empty() &&
                         checkPathList(directory.pathName, excludes_, caseSensitive_, false);
    }

    void skipEntry(WalkDirectory const& directory, WalkEntry const& entry, WalkSkip why) override
    {
        if (why != WalkSkip::Undecodable)
            return;
        FS_TRACE_FOR(log_, MID, className_, "scan", "file name len is 0. file skipped!");
        statistics_.addSkipped(FsQueryStatistics::SKIP_UNDECODABLE_NAME,
                               directory.narrowPath->c_str(), entry.name, 0);
    }

    WalkVisit visitEntry(WalkDirectory const& directory, WalkEntry const& entry, FsFileInfo& info,
                         bool known) override
    {
        WalkVisit visit;
        unsigned int attr = info.getAttr();  // a failed status call leaves attr 0: a file
        std::string const& directoryBytes = *directory.narrowPath;
        // An entry without status is stored as a file, and nothing below it is
        // read: past the system's 4095 bytes, or refused (a directory that may
        // be listed but not searched), or gone since the listing.  "." and
        // ".." are no entries of their own.
        if (!known && !entry.dot) {
            if (directory.prefixLength + entry.nameLength > DirectoryWalker::kMaxPath ||
                directoryBytes.size() + 1 + entry.nameBytes > DirectoryWalker::kMaxPath)
                statistics_.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(),
                                       entry.name, 0);
            else
                statistics_.addSkipped(FsQueryStatistics::SKIP_NO_STATUS, directoryBytes.c_str(),
                                       entry.name, fscanner::statusErrorOf(directoryBytes, entry.name));
        }

        if ((attr & FsFileInfo::ATTR_DIRECTORY) == 0) {
            Level& level = levelOf(directory);
            if (level.included && !level.excluded) {
                statistics_.addFile();
                ++cache_.filesScanned;
                if (cache_.filesScanned % CpuThreshold::CPU_THROTTLE_NO_OF_SCANNED_FILES_FACTOR == 0)
                    CpuThreshold::doIteration();
            }
            if (cache_.isFileToBeCached(query_, entry.wideName))
                writeFileRow(directory, entry, info, attr);
            return visit;
        }

        if (entry.dot || (attr & FsFileInfo::ATTR_SYMLINK) != 0 || !directory.path->getRecursive())
            return visit;
        if (directory.prefixLength + entry.nameLength > DirectoryWalker::kMaxPath) {
            FS_TRACE_FOR(log_, MID, className_, "scan", "'%S' path too long!", entry.wideName);
            statistics_.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, directoryBytes.c_str(),
                                   entry.name, 0);
            return visit;
        }
        if (!excludes_.empty() && checkPathList(entry.fullPath, excludes_, caseSensitive_, true)) {
            FS_TRACE_FOR(log_, MID, className_, "scan", "path '%S' excluded!", entry.fullPath);
            return visit;
        }
        // Written even when this directory's own files were not counted.
        ++directoriesIndex_;
        directories_.setFieldAsInt32(L"ID", directoriesIndex_);
        directories_.setFieldAsString(L"PATHNAME", entry.wideName);
        directories_.setFieldAsInt32(L"PARENTID", static_cast<unsigned int>(directory.tag));
        directories_.setFieldAsInt32(L"CREATIONTIME", static_cast<unsigned int>(time(nullptr)));
        directories_.insert();

        statistics_.addDirectory();
        ++cache_.directoriesScanned;
        visit.descend = true;
        visit.childTag = static_cast<int>(directoriesIndex_);
        return visit;
    }

    void leaveDirectory(WalkDirectory const& directory, int result) override
    {
        if (!directory.listed)
            return;
        FS_TRACE_FOR(log_, MAX, className_, "scan", "exit. [retValue is %d] [deep %d]", result,
                     logDepthOf(directory));
    }

private:
    struct Level {
        bool included = false;
        bool excluded = false;
    };
    Level& levelOf(WalkDirectory const& directory)
    {
        size_t depth = static_cast<size_t>(directory.depth);
        if (levels_.size() <= depth)
            levels_.resize(depth + 1);
        return levels_[depth];
    }
    // Folder-log depth left at this directory: one less per level, not below 0.
    int logDepthOf(WalkDirectory const& directory) const
    {
        return std::max(logDepth_ - directory.depth, 0);
    }

    void writeFileRow(WalkDirectory const& directory, WalkEntry const& entry, FsFileInfo& info,
                      unsigned int attr)
    {
        files_.setFieldAsString(L"FILENAME", entry.wideName);
        files_.setFieldAsInt64(L"SIZE", info.getSize());
        files_.setFieldAsInt32(L"ATTR", attr);
        files_.setFieldAsInt32(L"PATHID", static_cast<unsigned int>(directory.tag));
        if (!cache_.computeChecksums) {
            files_.setFieldAsString(L"MD5", L"0");
            files_.setFieldAsInt32(L"CRC32", 0);
            files_.setFieldAsInt32(L"Q32", 0);
        } else {
            FileChecksumInfo sums;
            sums.flags = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5;
            // Only a regular file is opened: a link, a pipe or a device keeps
            // zero sums.
            if ((attr & FsFileInfo::ATTR_REGULAR) != 0) {
                std::vector<char> narrowFile(fscanner::kNarrowFilePathBytes);
                if (fscanner::narrowFilePath(info.getPath(), info.getName(), narrowFile.data()))
                    computeRegularFileChecksumInfo(sums, narrowFile.data());
            }
            wchar_t md5Text[MD5_TEXT_SIZE];
            md52wchar_t(sums.md5, md5Text);
            files_.setFieldAsString(L"MD5", md5Text);
            files_.setFieldAsInt32(L"CRC32", sums.crc32);
            files_.setFieldAsInt32(L"Q32", sums.q32);
        }
        files_.insert();
    }

    FS_CacheBase& cache_;
    FsQuery const& query_;
    RecordSet& directories_;
    unsigned int& directoriesIndex_;
    RecordSet& files_;
    std::vector<PathInfo>& includes_;
    std::vector<PathInfo>& excludes_;
    bool caseSensitive_;
    int logDepth_;
    FsQueryStatistics& statistics_;
    QvLogWrapper* log_;
    char const* className_;
    std::string dfsPrefix_;
    fscanner::DfsTraceStyle dfsTraces_;
    std::vector<Level> levels_;
};

}  // namespace

void (*FS_CacheBase::scanHook)(char const* directory) = nullptr;

int FS_CacheBase::build(FsQuery const& query, PathDrive& root, RecordSet& directories,
                        unsigned int& directoriesIndex, RecordSet& files, RecordSet& directories2,
                        std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes,
                        bool caseSensitive, int timeoutMs)
{
    FS_TRACE(log, MID, "entry.");
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

    FS_TRACE(log, MID, "scan %S dir", rootPath);
    std::vector<wchar_t> rootCopy(rootPath, rootPath + wcslen(rootPath) + 1);
    if (!findPathByName(directories, directories2, rootCopy.data(), caseSensitive))
        return 0;
    // Stamped before the walk: a build that times out still leaves it fresh.
    directories.setFieldAsInt32(L"CREATIONTIME", static_cast<unsigned int>(time(nullptr)));
    directories.update();

    if (!excludes.empty() && checkPathList(rootPath, excludes, caseSensitive, root.getRecursive())) {
        FS_TRACE(log, MID, "path '%S' excluded!", rootPath);
        return 0;
    }
    if (!fs_isValidPath(rootCopy.data())) {
        FS_TRACE(log, MID, "'%S' is a symbolic link or is not a directory!", rootPath);
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
    CacheScanSink sink(*this, query, directories, directoriesIndex, files, includes, excludes,
                       caseSensitive, logDepth, queryStatistics());
    fscanner::WalkOptions options;
    options.conversion = {&narrowPathBuffer, &narrowPathBufferSize};
    options.caseSensitive = caseSensitive;
    DirectoryWalker walker(sink, options);
    return walker.walk(path, timeoutMs, parentId);
}
