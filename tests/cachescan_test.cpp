// The cache scan: the rows build and scan write for fixture trees, read back
// through cursors and compared literally.
#include <gtest/gtest.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <clocale>
#include <ctime>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

using testsupport::widen;
std::string narrow(const wchar_t* w)
{
    std::string out;
    for (; w != nullptr && *w; ++w)
        out += static_cast<char>(*w);
    return out;
}

struct DirRow {
    unsigned int id, parent, created;
    std::string name;
};
struct FileRow {
    std::string name;
    unsigned int attr, pathId, crc32, q32;
    unsigned long long size;
    std::string md5;
};

template <class Cache>
struct Fixture {
    testsupport::TempDir locks;
    testsupport::TempDir cacheDir;
    testsupport::TempDir traces;
    FsGlue glue;
    std::unique_ptr<Cache> cache;

    explicit Fixture(unsigned int checksumFlags = 0) {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        KelCfg::setKey("common_trace_path", traces.path().c_str());
        glue = testsupport::plainGlue();
        glue.checksumFlags = checksumFlags;
        cache.reset(new Cache(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue,
                              L"prov"));
        EXPECT_EQ(0, cache->create(0, FS_CACHE_CREATE));
    }
    ~Fixture() {
        cache->close();
        KelCfg::removeKey("common_trace_path");
    }
    int build(FsQuery const& query, const std::string& root, bool recursive, int timeoutMs,
              std::vector<PathInfo> excludes = std::vector<PathInfo>()) {
        DriveInfo drive(L"/:", dtLocal, L"ext4");
        PathDrive pathDrive(widen(root).c_str(), recursive, drive);
        std::vector<PathInfo> includes;
        return cache->build(query, pathDrive, *cache->directoriesCursor, cache->directoriesIndex,
                            *cache->filesCursor, *cache->directoriesCursor2, includes, excludes,
                            true, timeoutMs);
    }
    std::vector<DirRow> dirs() {
        std::vector<DirRow> out;
        RecordSet rs = cache->tbDirectories->openRecordSet();
        for (bool row = rs.moveFirst(); row; row = rs.moveNext())
            out.push_back({rs.getFieldAsInt32(L"ID"), rs.getFieldAsInt32(L"PARENTID"),
                           rs.getFieldAsInt32(L"CREATIONTIME"), narrow(rs.getFieldAsString(L"PATHNAME"))});
        cache->tbDirectories->closeRecordSet(rs);
        std::sort(out.begin(), out.end(), [](DirRow const& a, DirRow const& b) { return a.id < b.id; });
        return out;
    }
    std::vector<FileRow> files() {
        std::vector<FileRow> out;
        RecordSet rs = cache->tbFiles->openRecordSet();
        for (bool row = rs.moveFirst(); row; row = rs.moveNext())
            out.push_back({narrow(rs.getFieldAsString(L"FILENAME")), rs.getFieldAsInt32(L"ATTR"),
                           rs.getFieldAsInt32(L"PATHID"), rs.getFieldAsInt32(L"CRC32"),
                           rs.getFieldAsInt32(L"Q32"), rs.getFieldAsInt64(L"SIZE"),
                           narrow(rs.getFieldAsString(L"MD5"))});
        cache->tbFiles->closeRecordSet(rs);
        std::sort(out.begin(), out.end(),
                  [](FileRow const& a, FileRow const& b) { return a.name < b.name; });
        return out;
    }
    // Full path of each file row, rebuilt through the directory ids.
    std::vector<std::string> filePaths() {
        std::vector<std::string> out;
        std::vector<DirRow> d = dirs();
        std::map<unsigned int, DirRow> byId;
        for (auto& r : d)
            byId[r.id] = r;
        for (auto& f : files()) {
            std::string p = f.name;
            for (unsigned int id = f.pathId; id != 0; id = byId[id].parent) {
                std::string n = byId[id].name;
                p = (n == "/" ? "" : n) + "/" + p;
            }
            out.push_back(p);
        }
        std::sort(out.begin(), out.end());
        return out;
    }
};

// The components of a temporary directory's path, each a row from the top.
std::vector<std::string> components(const std::string& path)
{
    std::vector<std::string> out{"/"};
    size_t pos = 1;
    while (pos < path.size()) {
        size_t slash = path.find('/', pos);
        if (slash == std::string::npos)
            slash = path.size();
        if (slash > pos)
            out.push_back(path.substr(pos, slash - pos));
        pos = slash + 1;
    }
    return out;
}

std::string trimmed(std::string p)
{
    while (p.size() > 1 && p.back() == '/')
        p.pop_back();
    return p;
}

}  // namespace

TEST(CacheScan, RowsOfAFixtureTreeAreWrittenAsDescribed)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("a.txt", "abc");
    tree.write("sub/b.bin", "12345");
    tree.write("sub/inner/c", "");
    Fixture<FS_Cache> f;
    FsQuery q;
    time_t before = time(nullptr);
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, f.build(q, root, true, 60000));
    time_t after = time(nullptr);

    std::vector<std::string> parts = components(root);
    std::vector<DirRow> d = f.dirs();
    ASSERT_EQ(parts.size() + 2, d.size());
    // The chain down to the root: ids from 1, parent the previous one, and
    // a creation time of 0 except for the root, which the build stamps.
    for (size_t i = 0; i < parts.size(); ++i) {
        EXPECT_EQ(i + 1, d[i].id);
        EXPECT_EQ(i, d[i].parent);
        EXPECT_EQ(parts[i], d[i].name);
        if (i + 1 < parts.size()) {
            EXPECT_EQ(0u, d[i].created);
        }
    }
    unsigned int rootId = static_cast<unsigned int>(parts.size());
    EXPECT_GE(d[rootId - 1].created, static_cast<unsigned int>(before));
    EXPECT_LE(d[rootId - 1].created, static_cast<unsigned int>(after));
    // sub and sub/inner, stamped with the time of the scan.
    EXPECT_EQ("sub", d[rootId].name);
    EXPECT_EQ(rootId + 1, d[rootId].id);
    EXPECT_EQ(rootId, d[rootId].parent);
    EXPECT_EQ("inner", d[rootId + 1].name);
    EXPECT_EQ(rootId + 1, d[rootId + 1].parent);
    EXPECT_GE(d[rootId + 1].created, static_cast<unsigned int>(before));
    EXPECT_EQ(rootId + 2, f.cache->directoriesIndex);

    std::vector<FileRow> rows = f.files();
    ASSERT_EQ(3u, rows.size());
    EXPECT_EQ("a.txt", rows[0].name);
    EXPECT_EQ(rootId, rows[0].pathId);
    EXPECT_EQ(3u, rows[0].size);
    EXPECT_EQ(0u, rows[0].attr & FsFileInfo::ATTR_DIRECTORY);
    EXPECT_EQ("0", rows[0].md5);
    EXPECT_EQ(0u, rows[0].crc32);
    EXPECT_EQ(0u, rows[0].q32);
    EXPECT_EQ("b.bin", rows[1].name);
    EXPECT_EQ(rootId + 1, rows[1].pathId);
    EXPECT_EQ(5u, rows[1].size);
    EXPECT_EQ("c", rows[2].name);
    EXPECT_EQ(rootId + 2, rows[2].pathId);
    EXPECT_EQ(0u, rows[2].size);
    EXPECT_EQ(3, f.cache->filesScanned);
    EXPECT_EQ(2, f.cache->directoriesScanned);

    EXPECT_TRUE(cap.contains("FS_Cache::build - entry."));
    EXPECT_TRUE(cap.contains("FS_Cache::build - scan " + root + " dir"));
    EXPECT_TRUE(cap.contains("FS_Cache::scan - scanning " + root + " dir"));
    EXPECT_TRUE(cap.contains("FS_Cache::scan - exit. [retValue is 0] [deep "));
}

TEST(CacheScan, SecondRootUnderAKnownParentReusesItsRows)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("one/x", "1");
    tree.write("two/y", "2");
    Fixture<FS_Cache> f;
    FsQuery q;
    ASSERT_EQ(0, f.build(q, root + "/one", true, 60000));
    size_t rowsAfterFirst = f.dirs().size();
    ASSERT_EQ(0, f.build(q, root + "/two", true, 60000));
    // Only "two" is new: the chain above it was found.
    std::vector<DirRow> d = f.dirs();
    ASSERT_EQ(rowsAfterFirst + 1, d.size());
    EXPECT_EQ("two", d.back().name);
    EXPECT_EQ(d[rowsAfterFirst - 2].id, d.back().parent);
    EXPECT_EQ((std::vector<std::string>{root + "/one/x", root + "/two/y"}), f.filePaths());
}

TEST(CacheScan, LinkToADirectoryIsAFileRowAndIsNotFollowed)
{
    testsupport::TempDir tree;
    testsupport::TempDir elsewhere;
    std::string root = trimmed(tree.path());
    tree.write("plain", "abc");
    elsewhere.write("hidden/inside", "zzz");
    ASSERT_EQ(0, symlink(elsewhere.file("hidden").c_str(), (root + "/link").c_str()));
    Fixture<FS_Cache> f(0x20);  // checksums on
    ASSERT_TRUE(f.cache->computeChecksums);
    FsQuery q;
    ASSERT_EQ(0, f.build(q, root, true, 60000));
    std::vector<FileRow> rows = f.files();
    ASSERT_EQ(2u, rows.size());
    EXPECT_EQ("link", rows[0].name);
    EXPECT_NE(0u, rows[0].attr & FsFileInfo::ATTR_SYMLINK);
    EXPECT_EQ(0u, rows[0].attr & FsFileInfo::ATTR_DIRECTORY);
    EXPECT_EQ("00000000000000000000000000000000", rows[0].md5);
    EXPECT_EQ(0u, rows[0].crc32);
    EXPECT_EQ(0u, rows[0].q32);
    // The regular file gets its sums.
    EXPECT_EQ("plain", rows[1].name);
    EXPECT_EQ("900150983cd24fb0d6963f7d28e17f72", rows[1].md5);
    EXPECT_EQ(0x352441c2u, rows[1].crc32);
    for (auto& p : f.filePaths())
        EXPECT_EQ(std::string::npos, p.find("inside"));
}

TEST(CacheScan, NonRecursiveRootStoresOnlyItsOwnFiles)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("top.txt", "t");
    tree.write("sub/below.txt", "b");
    Fixture<FS_Cache> f;
    FsQuery q;
    size_t chain = components(root).size();
    ASSERT_EQ(0, f.build(q, root, false, 60000));
    EXPECT_EQ(chain, f.dirs().size());
    EXPECT_EQ((std::vector<std::string>{root + "/top.txt"}), f.filePaths());
}

TEST(CacheScan, ZeroTimeoutStoresNothingAndTimesOut)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("a", "1");
    tree.write("sub/b", "2");
    Fixture<FS_Cache> f;
    FsQuery q;
    testsupport::TraceCapture cap;
    EXPECT_EQ(2, f.build(q, root, true, 0));
    EXPECT_TRUE(f.files().empty());
    // Only the rows that carry the root's path; the root is stamped anyway.
    std::vector<DirRow> d = f.dirs();
    EXPECT_EQ(components(root).size(), d.size());
    EXPECT_NE(0u, d.back().created);
    EXPECT_TRUE(cap.contains("FS_Cache::scan - fs scanning timed out (timeout)"));
}

TEST(CacheScan, CachingSetSelectsRowsWhileEveryFileIsCounted)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("a.txt", "1");
    tree.write("b.log", "2");
    tree.write("sub/c.txt", "3");
    tree.write("sub/d.bin", "4");
    Fixture<FS_Cache2> f;
    FsQuery q;
    q.addFileOrMaskForCaching(L"*.txt");
    ASSERT_EQ(0, f.build(q, root, true, 60000));
    EXPECT_EQ((std::vector<std::string>{root + "/a.txt", root + "/sub/c.txt"}), f.filePaths());
    EXPECT_EQ(4, f.cache->filesScanned);
}

TEST(CacheScan, ExcludedSubdirectoryGetsNoRowAndIsNotRead)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("keep/k", "1");
    tree.write("skip/s", "2");
    tree.write("skip/deeper/t", "3");
    Fixture<FS_Cache> f;
    FsQuery q;
    std::vector<PathInfo> excludes;
    excludes.push_back(PathInfo(widen(root + "/skip").c_str(), true));
    testsupport::TraceCapture cap;
    ASSERT_EQ(0, f.build(q, root, true, 60000, excludes));
    for (auto& r : f.dirs()) {
        EXPECT_NE("skip", r.name);
        EXPECT_NE("deeper", r.name);
    }
    EXPECT_EQ((std::vector<std::string>{root + "/keep/k"}), f.filePaths());
    EXPECT_TRUE(cap.contains("FS_Cache::scan - path '" + root + "/skip' excluded!"));
    EXPECT_FALSE(cap.contains("scanning " + root + "/skip"));
}

TEST(CacheScan, ExcludedRootStoresNoRowsBelowIt)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("a", "1");
    Fixture<FS_Cache> f;
    FsQuery q;
    std::vector<PathInfo> excludes;
    excludes.push_back(PathInfo(widen(root).c_str(), true));
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, f.build(q, root, true, 60000, excludes));
    EXPECT_TRUE(f.files().empty());
    EXPECT_TRUE(cap.contains("FS_Cache::build - path '" + root + "' excluded!"));
}

TEST(CacheScan, NameNotValidInTheLocaleGetsNoRow)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("good", "1");
    tree.write(std::string("bad\xff\xfe"), "2");
    std::string saved = setlocale(LC_CTYPE, nullptr);
    ASSERT_NE(nullptr, setlocale(LC_CTYPE, "C.UTF-8"));
    Fixture<FS_Cache> f;
    FsQuery q;
    testsupport::TraceCapture cap;
    int rc = f.build(q, root, true, 60000);
    setlocale(LC_CTYPE, saved.c_str());
    EXPECT_EQ(0, rc);
    EXPECT_EQ((std::vector<std::string>{root + "/good"}), f.filePaths());
    EXPECT_TRUE(cap.contains("FS_Cache::scan - file name len is 0. file skipped!"));
}

TEST(CacheScan, MissingRootOrARootThatIsALinkStoresNoFiles)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("real/f", "1");
    ASSERT_EQ(0, symlink((root + "/real").c_str(), (root + "/alias").c_str()));
    Fixture<FS_Cache> f;
    FsQuery q;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, f.build(q, root + "/alias", true, 60000));
    EXPECT_TRUE(cap.contains("FS_Cache::build - '" + root +
                             "/alias' is a symbolic link or is not a directory!"));
    EXPECT_EQ(0, f.build(q, root + "/absent", true, 60000));
    EXPECT_TRUE(f.files().empty());
    EXPECT_TRUE(cap.contains("FS_Cache::scan - scandir error opening") ||
                cap.contains("is a symbolic link or is not a directory"));
}

TEST(CacheScan, UnreadableDirectoryIsNotAFailure)
{
    if (geteuid() == 0)
        GTEST_SKIP() << "root reads every directory";
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("open/a", "1");
    tree.write("closed/b", "2");
    ASSERT_EQ(0, chmod((root + "/closed").c_str(), 0));
    Fixture<FS_Cache> f;
    FsQuery q;
    testsupport::TraceCapture cap;
    int rc = f.build(q, root, true, 60000);
    chmod((root + "/closed").c_str(), 0755);
    EXPECT_EQ(0, rc);
    EXPECT_EQ((std::vector<std::string>{root + "/open/a"}), f.filePaths());
    EXPECT_TRUE(cap.contains("scandir error opening '" + root + "/closed' path!"));
}

TEST(CacheScan, ChildPastThePathLimitFailsItsStatusCallAndCountsAsAnEmptyFile)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    // Nest directories of 200 characters until the next one would pass 4095.
    std::string name(200, 'n');
    std::string path = root;
    while (path.size() + 1 + name.size() <= 4095) {
        path += "/" + name;
        ASSERT_EQ(0, mkdir(path.c_str(), 0755)) << path.size();
    }
    tree.write(path.substr(root.size() + 1) + "/leaf", "x");
    // The last level is made relative to its parent: its own path is too
    // long for the system calls that take whole paths.
    int parent = open(path.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(parent, 0);
    ASSERT_EQ(0, mkdirat(parent, name.c_str(), 0755));
    int child = openat(parent, name.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(child, 0);
    int below = openat(child, "below", O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(below, 0);
    close(below);
    close(child);
    close(parent);
    Fixture<FS_Cache> f;
    FsQuery q;
    EXPECT_EQ(0, f.build(q, root, true, 60000));
    // The status call of the overlong child fails: it is stored as a file
    // with attr 0 and size 0, and nothing below it is read.
    std::vector<std::string> paths = f.filePaths();
    ASSERT_EQ(2u, paths.size());
    EXPECT_EQ(path + "/leaf", paths[0]);
    EXPECT_EQ(path + "/" + name, paths[1]);
    for (auto& row : f.files()) {
        if (row.name == name) {
            EXPECT_EQ(0u, row.attr);
            EXPECT_EQ(0u, row.size);
        }
    }
}

TEST(CacheScan, FolderLogListsScannedDirectoriesToTheConfiguredDepth)
{
    testsupport::TempDir tree;
    std::string root = trimmed(tree.path());
    tree.write("l1/l2/l3/f", "1");
    Fixture<FS_Cache> f;
    KelCfg::setKey("trace_nested_folder_limit", "2");
    ASSERT_FALSE(openFolderListLogfile(&f.cache->folderLog));
    FsQuery q;
    int rc = f.build(q, root, true, 60000);
    closeFolderListLogfile(&f.cache->folderLog);
    KelCfg::removeKey("trace_nested_folder_limit");
    ASSERT_EQ(0, rc);
    std::string log = testsupport::readFile(f.traces.file("traceKEL_scanned_dirs.log"));
    EXPECT_NE(std::string::npos, log.find(" '" + root + "'\n"));
    EXPECT_NE(std::string::npos, log.find(" '" + root + "/l1'\n"));
    EXPECT_EQ(std::string::npos, log.find(" '" + root + "/l1/l2'\n"));
}

TEST(CacheScan, PathOverTheLimitAtEntryIsSkipped)
{
    Fixture<FS_Cache> f;
    FsQuery q;
    std::wstring longPath = L"/" + std::wstring(4095, L'p');
    DriveInfo drive(L"/:", dtLocal, L"ext4");
    PathDrive pathDrive(longPath.c_str(), true, drive);
    std::vector<PathInfo> none;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, f.cache->scan(q, pathDrive, *f.cache->directoriesCursor, f.cache->directoriesIndex,
                               *f.cache->filesCursor, 1, none, none, true, 60000, 0));
    EXPECT_TRUE(cap.contains("' path too long"));
    EXPECT_TRUE(f.files().empty());
    EXPECT_EQ(0u, f.cache->directoriesIndex);
}
