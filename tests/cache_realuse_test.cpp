// The cache in real use: a fixture tree of a few thousand files and
// directories with mounts of other kinds nested in it (told through a fixture
// mount table), queried through FS_Cache and FS_Cache2 and compared with what
// find(1) sees; answered from the cache files alone by a new object; and left
// behind by a process killed in the middle of a build.
#include <gtest/gtest.h>

#include <poll.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <set>
#include <string>
#include <vector>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/sync.h"
#include "support/cachefixture.h"

namespace {

using testsupport::plainGlue;
using testsupport::widen;
using PathWriter = testsupport::HitWriter;

// Lines printed by a find command, one path each.
std::set<std::string> findLines(const std::string& command)
{
    std::string out = testsupport::runCommand(command + " 2>/dev/null");
    std::set<std::string> lines;
    size_t pos = 0;
    while (pos < out.size()) {
        size_t nl = out.find('\n', pos);
        if (nl == std::string::npos)
            nl = out.size();
        if (nl > pos)
            lines.insert(out.substr(pos, nl - pos));
        pos = nl + 1;
    }
    return lines;
}

// The first few paths only in want and only in got, for failure output.
std::string difference(const std::set<std::string>& want, const std::set<std::string>& got)
{
    std::string out;
    int shown = 0;
    for (const std::string& p : want)
        if (got.count(p) == 0 && shown++ < 8)
            out += "\n  missing: " + p;
    shown = 0;
    for (const std::string& p : got)
        if (want.count(p) == 0 && shown++ < 8)
            out += "\n  extra:   " + p;
    return out;
}

// What the engine reports as files: regular files and symbolic links (a
// link is stored as a file and never followed).
std::string findFiles(const std::string& root, const std::string& tests)
{
    return "find '" + root + "' " + tests + " \\( -type f -o -type l \\) -print";
}

const unsigned int TEN_YEARS = 10u * 365u * 86400u;
const unsigned int GENEROUS_TIMEOUT = 600000;

// A cache that stops for good at its pauseAt-th file of a build, after
// telling the parent through fd: the parent then kills the process in the
// middle of the build.
class PausingCache : public FS_Cache {
public:
    PausingCache(const wchar_t* cachePath, FsGlue* glue, const wchar_t* provider, int pauseAt,
                 int fd)
        : FS_Cache(L"dirs", L"files", cachePath, false, true, glue, provider), pauseAt(pauseAt),
          fd(fd) {}
    bool isFileToBeCached(FsQuery const& query, wchar_t const* name) override {
        if (++seen == pauseAt) {
            char c = 'p';
            if (write(fd, &c, 1) != 1)
                _exit(5);
            for (;;)
                pause();
        }
        return FS_Cache::isFileToBeCached(query, name);
    }

private:
    int seen = 0;
    int pauseAt;
    int fd;
};

struct RealUseTest : ::testing::Test {
    testsupport::TempDir locks;
    bool storeSet = (LinuxSharedMutex::setStorePath(locks.path().c_str()), true);
    testsupport::TempDir sys;
    testsupport::TempDir traces;
    testsupport::TempDir work;
    testsupport::TempDir cacheDir;
    FsGlue glue = plainGlue();
    std::string tree;  // <work>/tree
    int fileCount = 0;
    int directoryCount = 0;
    unsigned int seed = 12345;

    RealUseTest() {
        tree = work.file("tree");
        sys.write("auto.master", "");
        MountTableManager::setMountTablePath(sys.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(sys.file("auto.master").c_str());
        KelCfg::setKey("common_trace_path", traces.path().c_str());
        makeFixture();
    }
    ~RealUseTest() override {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
        KelCfg::removeKey("common_trace_path");
    }

    unsigned int next() {
        seed = seed * 1103515245u + 12345u;
        return (seed >> 16) & 0x7fff;
    }

    // depth levels of three subdirectories each, 6 to 13 files per directory
    // with a mix of extensions, cases, blanks and sizes.
    void makeDirectory(const std::string& relative, int depth) {
        work.mkdirs(relative);
        ++directoryCount;
        static const char* const kinds[] = {".txt", ".log", ".dat", ".TXT", ".Txt", "", ".c"};
        int files = 6 + static_cast<int>(next() % 8);
        for (int f = 0; f < files; ++f) {
            unsigned int r = next();
            std::string name = (r % 11 == 0 ? "file " : "f") + std::to_string(f) + kinds[r % 7];
            work.write(relative + "/" + name, std::string(r % 300, 'x'));
            ++fileCount;
        }
        if (depth == 0)
            return;
        for (int d = 0; d < 3; ++d)
            makeDirectory(relative + "/s" + std::to_string(d), depth - 1);
    }

    // tree/{a..f}: ordinary directories on "/" (ext4), four levels deep.
    // tree/vol/xfs: an xfs disk (local, another file system: a root of its own).
    // tree/run/tmp: a tmpfs (local, another file system).
    // tree/net/share: an nfs export (remote: walked directly, never cached).
    // tree/same: another ext4 disk (same kind: walked with tree, and served
    //            from those rows when visited as a root of its own).
    // tree/proc: a proc mount (dummy: no drive at all).
    // Plus links to a file, to a directory and to nothing.
    void makeFixture() {
        for (const char* top : {"a", "b", "c", "d", "e", "f"})
            makeDirectory(std::string("tree/") + top, 3);
        makeDirectory("tree/vol/xfs", 2);
        makeDirectory("tree/run/tmp", 1);
        makeDirectory("tree/net/share", 2);
        makeDirectory("tree/same", 2);
        makeDirectory("tree/proc", 0);
        ASSERT_EQ(0, symlink((tree + "/a/f0.txt").c_str(), (tree + "/a/s0/tolink.txt").c_str()));
        ASSERT_EQ(0, symlink((tree + "/b").c_str(), (tree + "/a/s1/dirlink").c_str()));
        ASSERT_EQ(0, symlink((tree + "/nowhere").c_str(), (tree + "/c/broken.txt").c_str()));
        sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\n"
                          "/dev/sdb1 " + tree + "/vol/xfs xfs rw 0 0\n"
                          "tmpfs " + tree + "/run/tmp tmpfs rw 0 0\n"
                          "srv:/export " + tree + "/net/share nfs rw 0 0\n"
                          "/dev/sdc1 " + tree + "/same ext4 rw 0 0\n"
                          "proc " + tree + "/proc proc rw 0 0\n");
    }

    // The cache directory of the test; a drill may move it to a fresh one.
    std::string cacheLocation = cacheDir.path();
    std::wstring cachePath() const { return widen(cacheLocation); }

    // q asks for expression over the whole tree, recursively: a plain path
    // reaches the local drives only, so the remote mounts below the tree are
    // asked for by a second path with the media word.
    void treeQuery(FsQuery& q, const wchar_t* expression, bool caseSensitive = true,
                   bool withRemote = true) {
        q.setQuery(expression);
        q.setCaseSensitive(caseSensitive ? 0 : 1);
        q.addIncludePath(widen(tree).c_str(), true);
        if (withRemote)
            q.addIncludePath(widen("$remote::" + tree).c_str(), true);
    }

    // One query on a fresh object over cacheDir: create, lock, query,
    // unlock, close, as a caller does.
    template <class Cache>
    int runQuery(FsQuery& q, PathWriter& w, unsigned int maxCacheAge,
                 const wchar_t* provider = L"prov") {
        Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, provider);
        EXPECT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        EXPECT_EQ(0, c.lock());
        int rc = c.executeQueryEx(w, q, GENEROUS_TIMEOUT, maxCacheAge);
        c.unlock();
        c.close();
        return rc;
    }

    // Waits for one byte from the child; 0 when it closed the pipe instead.
    char awaitChild(int fd) {
        pollfd p{fd, POLLIN, 0};
        if (poll(&p, 1, 120000) != 1)
            return 0;
        char c = 0;
        if (read(fd, &c, 1) != 1)
            return 0;
        return c;
    }

    void killChild(pid_t pid) {
        ASSERT_EQ(0, kill(pid, SIGKILL));
        int status = 0;
        ASSERT_EQ(pid, waitpid(pid, &status, 0));
        ASSERT_TRUE(WIFSIGNALED(status));
        EXPECT_EQ(SIGKILL, WTERMSIG(status));
    }

    // A child that runs q through a PausingCache over cacheDir and stops at
    // its pauseAt-th file; provider lets the child disown an older tree.
    pid_t startPausingChild(FsQuery& q, int pauseAt, const wchar_t* provider, unsigned int maxAge,
                            int* readFd) {
        int fds[2];
        if (pipe(fds) != 0)
            return -1;
        pid_t pid = fork();
        if (pid == 0) {
            close(fds[0]);
            PausingCache c(cachePath().c_str(), &glue, provider, pauseAt, fds[1]);
            if (c.create(0, FS_CACHE_OPEN_ALWAYS) != 0)
                _exit(3);
            if (c.lock() != 0)
                _exit(4);
            PathWriter w;
            c.executeQueryEx(w, q, GENEROUS_TIMEOUT, maxAge);
            // Reached only when the build ended before pauseAt files.
            char done = 'd';
            if (write(fds[1], &done, 1) != 1)
                _exit(6);
            for (;;)
                pause();
        }
        close(fds[1]);
        *readFd = fds[0];
        return pid;
    }

    // After a killed process: FS_CACHE_OPEN refuses the cache, and a query
    // on an object that tried it gets -40; FS_CACHE_OPEN_ALWAYS then starts
    // anew and the answer is the whole tree, never a part.
    void expectRefusedThenRebuiltWhole(FsQuery& q, const std::set<std::string>& expected) {
        {
            FS_Cache probe(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
            testsupport::TraceCapture cap;
            EXPECT_EQ(-53, probe.create(0, FS_CACHE_OPEN));
            EXPECT_FALSE(probe.cacheOpened);
            EXPECT_TRUE(probe.cacheUnusable);
            EXPECT_TRUE(cap.contains("FS_Cache::openCache() - cache corrupted or directoriesIndex invalid"));
            PathWriter none;
            EXPECT_EQ(-40, probe.executeQueryEx(none, q, GENEROUS_TIMEOUT, TEN_YEARS));
            EXPECT_TRUE(none.hits.empty());
        }
        FS_Cache fresh(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, fresh.create(0, FS_CACHE_OPEN_ALWAYS));
        EXPECT_FALSE(fresh.cacheUnusable);
        // The killed holder's lock went with it.
        EXPECT_EQ(0, fresh.lock(2000));
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, fresh.executeQueryEx(w, q, GENEROUS_TIMEOUT, TEN_YEARS));
        fresh.unlock();
        EXPECT_TRUE(cap.contains("IMPORTANT: File system access on '" + tree + "'"));
        EXPECT_FALSE(cap.contains("retrieving data from cache for '" + tree + "'"));
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
        EXPECT_EQ(expected.size(), w.records);  // nothing of the old tables twice
        fresh.close();
        EXPECT_FALSE(testsupport::fileExists(cacheLocation + "/dirs.cuflag"));

        // And the rebuilt cache opens cleanly and serves the same answer.
        FS_Cache again(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, again.create(0, FS_CACHE_OPEN));
        PathWriter w2;
        testsupport::TraceCapture cap2;
        EXPECT_EQ(0, again.executeQueryEx(w2, q, GENEROUS_TIMEOUT, TEN_YEARS));
        EXPECT_TRUE(cap2.contains("retrieving data from cache for '" + tree + "'"));
        EXPECT_TRUE(expected == w2.hits) << difference(expected, w2.hits);
        again.close();
    }
};

}  // namespace

TEST_F(RealUseTest, FixtureIsAFewThousandEntriesDeep)
{
    EXPECT_GT(fileCount, 2000);
    EXPECT_GT(directoryCount, 250);
    EXPECT_EQ(static_cast<size_t>(fileCount) + 3, findLines(findFiles(tree, "")).size());
}

TEST_F(RealUseTest, FsCacheAgreesWithFindOverNestedMountsOfOtherKinds)
{
    FsQuery all;
    treeQuery(all, L"[SIZE]>=0");
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, runQuery<FS_Cache>(all, w, TEN_YEARS));
    std::set<std::string> expected = findLines(findFiles(tree, ""));
    EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    EXPECT_EQ(expected.size(), w.records);
    // The ext4 tree, the xfs disk and the tmpfs are cached roots of their own;
    // the nfs export is walked directly; the second ext4 disk and the proc
    // mount are part of the walk of the tree.
    EXPECT_TRUE(cap.contains("IMPORTANT: (OK) File system access on '" + tree + "' (drive: '/:', type: 2, fs: 'ext4')"));
    EXPECT_TRUE(cap.contains("IMPORTANT: (OK) File system access on '" + tree + "/vol/xfs' (drive: '" + tree + "/vol/xfs:', type: 2, fs: 'xfs')"));
    EXPECT_TRUE(cap.contains("IMPORTANT: (OK) File system access on '" + tree + "/run/tmp' (drive: '" + tree + "/run/tmp:', type: 2, fs: 'tmpfs')"));
    EXPECT_TRUE(cap.contains("scanning [mdRemoteDriveGroup] and [mdOtherDriveGroup] [" + tree + "/net/share] path..."));
    EXPECT_FALSE(cap.contains("File system access on '" + tree + "/same'"));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + tree + "/same' (drive: '" + tree + "/same:', type: 2, fs: 'ext4')"));
    EXPECT_FALSE(cap.contains("File system access on '" + tree + "/net/share'"));
    EXPECT_EQ(1u, cap.count("IMPORTANT: BUILDING CACHE SUMMARY - "));
}

TEST_F(RealUseTest, WithRemoteCachingTheNfsExportIsACachedRootToo)
{
    glue.cacheRemoteDrives = true;
    FsQuery all;
    treeQuery(all, L"[SIZE]>=0");
    std::set<std::string> expected = findLines(findFiles(tree, ""));
    {
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, runQuery<FS_Cache>(all, w, TEN_YEARS));
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
        EXPECT_EQ(expected.size(), w.records);
        EXPECT_TRUE(cap.contains("IMPORTANT: (OK) File system access on '" + tree + "/net/share' (drive: '" + tree + "/net/share:', type: 4, fs: 'nfs')"));
        EXPECT_FALSE(cap.contains("[mdRemoteDriveGroup]"));
    }
    // Served from the cache alone, the export included.
    std::string moved = work.file("moved");
    ASSERT_EQ(0, rename(tree.c_str(), moved.c_str()));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, runQuery<FS_Cache>(all, w, TEN_YEARS));
    ASSERT_EQ(0, rename(moved.c_str(), tree.c_str()));
    EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    EXPECT_FALSE(cap.contains("File system access on"));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + tree + "/net/share'"));
}

TEST_F(RealUseTest, PlainPathReachesOnlyTheLocalDrivesBelowIt)
{
    FsQuery local;
    treeQuery(local, L"[SIZE]>=0", true, false);
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, runQuery<FS_Cache>(local, w, TEN_YEARS));
    std::set<std::string> expected = findLines(
        "find '" + tree + "' -path '" + tree + "/net/share' -prune -o \\( -type f -o -type l \\) -print");
    EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    EXPECT_FALSE(cap.contains("[mdRemoteDriveGroup]"));
    // The tree, the tmpfs and the xfs disk are built; the second ext4 disk is
    // a root too, but the walk of the tree already wrote its rows.
    EXPECT_EQ(3u, cap.count("IMPORTANT: (OK) File system access on '"));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + tree + "/same'"));
}

TEST_F(RealUseTest, FsCacheNameMasksAgreeWithFind)
{
    {
        FsQuery q;
    treeQuery(q, L"[FILENAME]==\"*.txt\"");
        PathWriter w;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(findFiles(tree, "-name '*.txt'"));
        EXPECT_GT(expected.size(), 200u);
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    }
    {
        // Case-insensitive: .txt, .TXT and .Txt alike.
        FsQuery q;
    treeQuery(q, L"[FILENAME]==\"*.txt\"", false);
        PathWriter w;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(findFiles(tree, "-iname '*.txt'"));
        EXPECT_GT(expected.size(), findLines(findFiles(tree, "-name '*.txt'")).size());
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    }
    {
        // An exact name goes through the FILENAME index.
        FsQuery q;
    treeQuery(q, L"[FILENAME]==\"f3.dat\"");
        PathWriter w;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(findFiles(tree, "-name 'f3.dat'"));
        EXPECT_FALSE(expected.empty());
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    }
    {
        FsQuery q;
    treeQuery(q, L"[FILENAME]==\"file *\" && [SIZE]>150");
        PathWriter w;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(findFiles(tree, "-name 'file *' -size +150c"));
        EXPECT_FALSE(expected.empty());
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    }
}

TEST_F(RealUseTest, FsCachePathsAndExcludesAgreeWithFind)
{
    // Build the whole tree once; the narrower queries below are then served
    // from it (their roots lie inside the scanned tree).
    FsQuery all;
    treeQuery(all, L"[SIZE]>=0");
    PathWriter first;
    ASSERT_EQ(0, runQuery<FS_Cache>(all, first, TEN_YEARS));
    {
        FsQuery q;
        q.setQuery(L"[SIZE]<200");
        q.addIncludePath(widen(tree + "/b/s1").c_str(), true);
        q.addIncludePath(widen(tree + "/c/s2/s0").c_str(), false);
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(findFiles(tree + "/b/s1", "-size -200c"));
        std::set<std::string> flat =
            findLines(findFiles(tree + "/c/s2/s0", "-maxdepth 1 -size -200c"));
        expected.insert(flat.begin(), flat.end());
        EXPECT_FALSE(flat.empty());
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
        EXPECT_FALSE(cap.contains("IMPORTANT: File system access on"));
    }
    {
        // Excluded paths, and an excluded file system: the nfs export drops
        // out of the answer and out of every walk.
        FsQuery q;
    treeQuery(q, L"[SIZE]>=0");
        q.addExcludePath(widen(tree + "/d").c_str(), true);
        q.addExcludePath(widen(tree + "/vol/xfs/s1").c_str(), true);
        q.addExcludeFileSystem(L"nfs");
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, runQuery<FS_Cache>(q, w, TEN_YEARS));
        std::set<std::string> expected = findLines(
            "find '" + tree + "' \\( -path '" + tree + "/d' -o -path '" + tree +
            "/vol/xfs/s1' -o -path '" + tree + "/net/share' \\) -prune -o \\( -type f -o -type l \\) -print");
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
        EXPECT_FALSE(cap.contains("[mdRemoteDriveGroup]"));
    }
}

TEST_F(RealUseTest, FsCache2CachesOnlyTheMaskedNamesAndAgreesWithFind)
{
    FsQuery q;
    treeQuery(q, L"[FILENAME]==\"*.log\" || [FILENAME]==\"f1*\"");
    q.addFileOrMaskForCaching(L"*.log");
    q.addFileOrMaskForCaching(L"f1*");
    PathWriter w;
    EXPECT_EQ(0, runQuery<FS_Cache2>(q, w, TEN_YEARS));
    std::set<std::string> expected =
        findLines(findFiles(tree, "\\( -name '*.log' -o -name 'f1*' \\)"));
    EXPECT_GT(expected.size(), 300u);
    EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);

    // Only those names went into the cache: an everything query served from
    // it gives the same set (apart from the directly walked nfs export).
    FsQuery everything;
    treeQuery(everything, L"[SIZE]>=0");
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, runQuery<FS_Cache2>(everything, w2, TEN_YEARS));
    EXPECT_TRUE(cap.contains("FS_Cache2::saveOrRestoreFilesOrMasksForCaching - reloading catalog set from cache."));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + tree + "'"));
    std::set<std::string> cachedPart;
    for (const std::string& p : expected)
        if (p.compare(0, tree.size() + 11, tree + "/net/share/") != 0)
            cachedPart.insert(p);
    std::set<std::string> walked = findLines(findFiles(tree + "/net/share", ""));
    cachedPart.insert(walked.begin(), walked.end());
    EXPECT_TRUE(cachedPart == w2.hits) << difference(cachedPart, w2.hits);
}

TEST_F(RealUseTest, RemoteRootWalkedBeforeALocalOneLeavesTheCacheLookupsWorking)
{
    // Roots are visited in path order: the nfs export comes before the xfs
    // disk, so the direct walk (with its own expression commands) runs before
    // the first lookup of the cache.
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + tree + "/net/share").c_str(), true);
    q.addIncludePath(widen(tree + "/vol/xfs").c_str(), true);
    std::set<std::string> expected = findLines(findFiles(tree + "/net/share", ""));
    std::set<std::string> xfs = findLines(findFiles(tree + "/vol/xfs", ""));
    expected.insert(xfs.begin(), xfs.end());
    {
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, c.executeQueryEx(w, q, GENEROUS_TIMEOUT, TEN_YEARS));
        EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
        EXPECT_EQ(expected.size(), w.records);
        std::string dump = cap.dump();
        EXPECT_LT(dump.find("[mdRemoteDriveGroup]"), dump.find("[mdLocalDriveGroup]"));
    }
    // Later, on the same object: the xfs tree is too old and is removed, its
    // file rows with it, and written again.
    sleep(1);
    work.write("tree/vol/xfs/s0/late.txt", "late");
    expected.insert(tree + "/vol/xfs/s0/late.txt");
    FsQuery again;
    again.setQuery(L"[SIZE]>=0");
    again.addIncludePath(widen(tree + "/vol/xfs").c_str(), true);
    again.addIncludePath(widen("$remote::" + tree + "/net/share").c_str(), true);
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, again, GENEROUS_TIMEOUT, 0));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - tree removed!"));
    EXPECT_TRUE(expected == w.hits) << difference(expected, w.hits);
    EXPECT_EQ(expected.size(), w.records);
    EXPECT_FALSE(c.cacheUnusable);
    c.close();
}

TEST_F(RealUseTest, NewObjectWithLargeMaxCacheAgeAnswersWithTheTreeRenamedAway)
{
    FsQuery q;
    treeQuery(q, L"[FILENAME]==\"*.txt\" || [SIZE]>250", false, false);
    q.addExcludeFileSystem(L"nfs");
    PathWriter w1;
    ASSERT_EQ(0, runQuery<FS_Cache>(q, w1, TEN_YEARS));
    ASSERT_GT(w1.hits.size(), 300u);

    // Nothing of the tree is there any more: only the cache can answer.
    std::string moved = work.file("moved");
    ASSERT_EQ(0, rename(tree.c_str(), moved.c_str()));
    for (int round = 0; round < 2; ++round) {
        PathWriter w2;
        testsupport::TraceCapture cap;
        if (round == 0)
            EXPECT_EQ(0, runQuery<FS_Cache>(q, w2, TEN_YEARS));
        else
            EXPECT_EQ(0, runQuery<FS_Cache>(q, w2, 0xffffffffu / 4));
        EXPECT_TRUE(w1.hits == w2.hits) << difference(w1.hits, w2.hits);
        EXPECT_EQ(w1.records, w2.records);
        EXPECT_FALSE(cap.contains("File system access on")) << cap.dump();
        EXPECT_EQ(4u, cap.count("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - retrieving data from cache for '"));
        for (const char* root : {"'", "/run/tmp'", "/same'", "/vol/xfs'"})
            EXPECT_TRUE(cap.contains("retrieving data from cache for '" + tree + root)) << root;
    }
    ASSERT_EQ(0, rename(moved.c_str(), tree.c_str()));
}

TEST_F(RealUseTest, KillInTheMiddleOfAFirstBuildLeavesACacheOpenRefuses)
{
    FsQuery q;
    treeQuery(q, L"[SIZE]>=0");
    std::set<std::string> expected = findLines(findFiles(tree, ""));
    int fd = -1;
    pid_t pid = startPausingChild(q, fileCount / 2, L"prov", TEN_YEARS, &fd);
    ASSERT_GT(pid, 0);
    char said = awaitChild(fd);
    close(fd);
    killChild(pid);
    ASSERT_EQ('p', said) << "the child did not stop in the middle of its build";

    // The dead process left its tables, its update flag and its lock file.
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("dirs.cuflag")));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("dirs.counter")));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("files.dat")));
    expectRefusedThenRebuiltWhole(q, expected);
}

TEST_F(RealUseTest, KillInTheMiddleOfARebuildNeverServesThePartialTree)
{
    FsQuery q;
    treeQuery(q, L"[SIZE]>=0");
    std::set<std::string> expected = findLines(findFiles(tree, ""));
    PathWriter complete;
    ASSERT_EQ(0, runQuery<FS_Cache>(q, complete, TEN_YEARS));
    ASSERT_EQ(expected, complete.hits);

    // Another provider disowns the tree: the child removes it (the rows of
    // the roots below it hang on its rows and go too) and dies while writing
    // it again, early and late in the walk of the tree itself, which leaves
    // out the mounts of other kinds below it.
    int walked = static_cast<int>(findLines(
        "find '" + tree + "' \\( -path '" + tree + "/vol/xfs' -o -path '" + tree +
        "/run/tmp' -o -path '" + tree + "/net/share' \\) -prune -o \\( -type f -o -type l \\) -print").size());
    ASSERT_GT(walked, 2000);
    for (int pauseAt : {5, walked - 20}) {
        int fd = -1;
        pid_t pid = startPausingChild(q, pauseAt, L"another provider", TEN_YEARS, &fd);
        ASSERT_GT(pid, 0);
        char said = awaitChild(fd);
        close(fd);
        killChild(pid);
        ASSERT_EQ('p', said) << "pause at " << pauseAt;
        expectRefusedThenRebuiltWhole(q, expected);
    }
}

TEST_F(RealUseTest, KillAtAnyMomentLeavesNothingThatOpens)
{
    FsQuery q;
    treeQuery(q, L"[FILENAME]==\"*.dat\"");
    std::set<std::string> expected = findLines(findFiles(tree, "-name '*.dat'"));
    // The child holds the cache open until it is killed, whether its query
    // ended or not; the timer falls before, during or after the build.  Each
    // round starts without a cache, so no complete one can be found.
    for (int delayMs : {0, 40, 250, 3000}) {
        cacheLocation = cacheDir.mkdirs("after" + std::to_string(delayMs));
        int fds[2];
        ASSERT_EQ(0, pipe(fds));
        pid_t pid = fork();
        ASSERT_GE(pid, 0);
        if (pid == 0) {
            close(fds[0]);
            char ready = 'r';
            if (write(fds[1], &ready, 1) != 1)
                _exit(6);
            FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
            if (c.create(0, FS_CACHE_OPEN_ALWAYS) != 0 || c.lock() != 0)
                _exit(3);
            PathWriter w;
            c.executeQueryEx(w, q, GENEROUS_TIMEOUT, 0);
            for (;;)
                pause();
        }
        close(fds[1]);
        char said = awaitChild(fds[0]);
        close(fds[0]);
        usleep(static_cast<useconds_t>(delayMs) * 1000);
        killChild(pid);
        ASSERT_EQ('r', said);
        SCOPED_TRACE("killed after " + std::to_string(delayMs) + " ms");
        expectRefusedThenRebuiltWhole(q, expected);
    }
}
