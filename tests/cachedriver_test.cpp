#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/sync.h"
#include "support/cachefixture.h"

namespace {

using testsupport::widen;
std::string narrow(const wchar_t* w) { return testsupport::bytesOf(w); }

class RecordingWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t*, const wchar_t*, unsigned long long, unsigned int, const wchar_t*,
                  unsigned int, unsigned int) override {
        return -1;
    }
    int addRecord(const FsFileInfo& info) override {
        paths.push_back(narrow(info.getPath()) + "|" + narrow(info.getName()));
        return 0;
    }
    int close() override { return 0; }
    std::vector<std::string> paths;
    bool contains(const std::string& name) const {
        for (const std::string& p : paths)
            if (p.size() >= name.size() && p.compare(p.size() - name.size(), name.size(), name) == 0)
                return true;
        return false;
    }
};

struct DriverTest : ::testing::Test {
    testsupport::TempDir locks;
    testsupport::TempDir cacheDir;
    testsupport::TempDir tree;
    testsupport::TempDir sys;
    testsupport::TempDir traces;
    FsGlue glue;
    std::string remote;
    DriverTest() {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        glue = testsupport::plainGlue();
        remote = tree.mkdirs("remote");
        tree.write("remote/a.txt", "aaaa");
        tree.write("remote/sub/b.txt", "bb");
        tree.write("local/c.txt", "c");
        sys.write("auto.master", "");
        sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\n");
        MountTableManager::setMountTablePath(sys.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(sys.file("auto.master").c_str());
        // A build writes the folder log there, never to the real trace path.
        KelCfg::setKey("common_trace_path", traces.path().c_str());
    }
    ~DriverTest() override {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
        KelCfg::removeKey("common_trace_path");
    }
    void addRemoteMount() {
        sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\nsrv:/export " + remote + " nfs rw 0 0\n");
    }
};

}  // namespace

TEST_F(DriverTest, QueryOnUnopenedCacheReturnsUnusable)
{
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    FsQuery q;
    RecordingWriter w;
    EXPECT_EQ(-40, c.executeQueryEx(w, q, 1000, 60));
    c.cacheOpened = true;
    c.cacheUnusable = true;
    EXPECT_EQ(-40, c.executeQueryEx(w, q, 1000, 60));
}

TEST_F(DriverTest, RemoteRootIsWalkedDirectlyIntoWriter)
{
    addRemoteMount();
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + remote).c_str(), true);
    RecordingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 10000, 60));
    EXPECT_TRUE(cap.contains("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - CpuThreshold is set to: 0:0:0:0"));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - scanning [mdRemoteDriveGroup] and [mdOtherDriveGroup] ["));
    EXPECT_TRUE(w.contains("a.txt"));
    EXPECT_TRUE(w.contains("b.txt"));
    EXPECT_FALSE(c.firstQuery);
    EXPECT_FALSE(c.cacheUnusable);
    // Nothing went into the cache: no directory id was handed out.
    EXPECT_EQ(0u, c.directoriesIndex);
    c.close();
}

TEST_F(DriverTest, UnreachableRemoteRootStillSucceeds)
{
    addRemoteMount();
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + remote + "/missing").c_str(), true);
    RecordingWriter w;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 10000, 60));
    EXPECT_TRUE(w.paths.empty());
    c.close();
}

TEST_F(DriverTest, LocalRootTakesTheLocalBranchNotTheDirectWalk)
{
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(tree.file("local")).c_str(), true);
    RecordingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 10000, 60));
    EXPECT_FALSE(cap.contains("scanning [mdRemoteDriveGroup]"));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - scanning [mdLocalDriveGroup] ["));
    EXPECT_TRUE(cap.contains("IMPORTANT: File system access on '"));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - exit. [retValue is 0]"));
    c.close();
}

TEST_F(DriverTest, MountAddedAfterFirstQueryIsNotSeen)
{
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + remote).c_str(), true);
    RecordingWriter w1;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 10000, 60));
    EXPECT_TRUE(w1.paths.empty());  // only "/" is known: no remote drive holds the path
    addRemoteMount();
    RecordingWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w2, q, 10000, 60));
    EXPECT_TRUE(w2.paths.empty());
    EXPECT_FALSE(cap.contains("CpuThreshold is set to"));  // no second drive list
    // A new object sees the mount.
    FS_Cache fresh(L"dirs2", L"files2", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, fresh.create(0, FS_CACHE_CREATE));
    RecordingWriter w3;
    EXPECT_EQ(0, fresh.executeQueryEx(w3, q, 10000, 60));
    EXPECT_TRUE(w3.contains("a.txt"));
    fresh.close();
    c.close();
}

TEST_F(DriverTest, FirstTimeOnlySecondQueryIgnoresChangedPaths)
{
    addRemoteMount();
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.setFirstTimeOnly(true);
    q.addIncludePath(widen("$remote::" + remote + "/sub").c_str(), true);
    RecordingWriter w1;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 10000, 60));
    EXPECT_TRUE(w1.contains("b.txt"));
    EXPECT_FALSE(w1.contains("a.txt"));
    ASSERT_EQ(1u, c.prevIncludedPaths.size());

    FsQuery q2;
    q2.setQuery(L"[SIZE]>=0");
    q2.setFirstTimeOnly(true);
    q2.addIncludePath(widen("$remote::" + remote).c_str(), true);
    RecordingWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w2, q2, 10000, 60));
    EXPECT_TRUE(w2.paths.empty());
    EXPECT_FALSE(cap.contains("scanning [mdRemoteDriveGroup]"));
    EXPECT_EQ(widen("$remote::" + remote + "/sub"), std::wstring(c.prevIncludedPaths[0].getPathName()));
    c.close();
}

TEST_F(DriverTest, UnchangedQueryKeepsResolutionAndClearsChangeFlags)
{
    addRemoteMount();
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + remote).c_str(), true);
    RecordingWriter w1, w2;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 10000, 60));
    EXPECT_TRUE(c.pathsChanged);
    EXPECT_EQ(0, c.executeQueryEx(w2, q, 10000, 60));
    EXPECT_FALSE(c.pathsChanged);
    EXPECT_FALSE(c.fileSystemsChanged);
    EXPECT_EQ(w1.paths.size(), w2.paths.size());
    q.addExcludeFileSystem(L"tmpfs");
    RecordingWriter w3;
    EXPECT_EQ(0, c.executeQueryEx(w3, q, 10000, 60));
    EXPECT_FALSE(c.pathsChanged);
    EXPECT_TRUE(c.fileSystemsChanged);
    c.close();
}

TEST_F(DriverTest, ThrottleMessageShowsShareOfRunTime)
{
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setCpuThreshold("1:1:30:10");
    RecordingWriter w;
    {
        testsupport::TraceCapture cap;
        c.executeQueryEx(w, q, 1000, 60);
        EXPECT_TRUE(cap.contains("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - CpuThreshold is set to: 75.0% (1:1:30:10)."));
    }
    FS_Cache c2(L"d2", L"f2", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c2.create(0, FS_CACHE_CREATE));
    FsQuery q2;
    q2.setCpuThreshold("1:1:30:0");
    {
        testsupport::TraceCapture cap;
        c2.executeQueryEx(w, q2, 1000, 60);
        EXPECT_TRUE(cap.contains("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - CpuThreshold is set to : 100% (1:1:30:0)."));
    }
    FS_Cache c3(L"d3", L"f3", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c3.create(0, FS_CACHE_CREATE));
    FsQuery q3;
    q3.setCpuThreshold("5:5");
    {
        testsupport::TraceCapture cap;
        c3.executeQueryEx(w, q3, 1000, 60);
        EXPECT_TRUE(cap.contains("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - CpuThreshold is set to: 0:0:0:0"));
    }
    c.close();
    c2.close();
    c3.close();
}

TEST(SameListsTest, ReorderedOrResizedListsDiffer)
{
    std::vector<PathInfo> a{PathInfo(L"/a", true), PathInfo(L"/b", false)};
    std::vector<PathInfo> same{PathInfo(L"/a", true), PathInfo(L"/b", false)};
    std::vector<PathInfo> swapped{PathInfo(L"/b", false), PathInfo(L"/a", true)};
    std::vector<PathInfo> flag{PathInfo(L"/a", false), PathInfo(L"/b", false)};
    std::vector<PathInfo> shorter{PathInfo(L"/a", true)};
    EXPECT_TRUE(samePathList(a, same));
    EXPECT_FALSE(samePathList(a, swapped));
    EXPECT_FALSE(samePathList(a, flag));
    EXPECT_FALSE(samePathList(a, shorter));
    std::vector<FileSystemInfo> f1{FileSystemInfo(L"nfs"), FileSystemInfo(L"ext4")};
    std::vector<FileSystemInfo> f2{FileSystemInfo(L"ext4"), FileSystemInfo(L"nfs")};
    std::vector<FileSystemInfo> f3{FileSystemInfo(L"nfs"), FileSystemInfo(L"ext4")};
    EXPECT_FALSE(sameFileSystemList(f1, f2));
    EXPECT_TRUE(sameFileSystemList(f1, f3));
}

TEST_F(DriverTest, AutomounterRemoteEntryIsWalkedDirectly)
{
    std::string misc = tree.mkdirs("misc");
    tree.write("misc/data/d.txt", "ddd");
    sys.write("auto.misc", "data server:/export/data\n");
    sys.write("auto.master", misc + " " + sys.file("auto.misc") + "\n");
    FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen("$remote::" + misc + "/data").c_str(), true);
    RecordingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 10000, 60));
    EXPECT_TRUE(w.contains("d.txt")) << cap.dump();
    c.close();
}
