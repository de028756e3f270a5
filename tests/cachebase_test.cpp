#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <set>
#include <string>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/recordset.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

using testsupport::widen;

std::set<std::string> listDir(const std::string& path)
{
    std::set<std::string> names;
    DIR* d = opendir(path.c_str());
    if (d == nullptr)
        return names;
    while (dirent* e = readdir(d)) {
        std::string n = e->d_name;
        if (n != "." && n != "..")
            names.insert(n);
    }
    closedir(d);
    return names;
}

std::string word(uint32_t v) { return std::string(reinterpret_cast<char*>(&v), 4); }

struct CacheTest : ::testing::Test {
    testsupport::TempDir locks;
    testsupport::TempDir dir;
    std::wstring wdir;
    FsGlue glue;
    CacheTest() : wdir(widen(dir.path())) {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        glue = testsupport::plainGlue();
    }
};

}  // namespace

TEST_F(CacheTest, ConstructorCopiesGlueAndNamesClass)
{
    glue.checksumFlags = 0x20;
    glue.cacheRemoteDrives = true;
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_TRUE(c.cacheInitialized);
    EXPECT_FALSE(c.cacheOpened);
    EXPECT_TRUE(c.computeChecksums);
    EXPECT_TRUE(c.cacheRemoteDrives);
    EXPECT_STREQ("FS_Cache", c.className);
    EXPECT_TRUE(c.firstQuery);
    EXPECT_TRUE(c.pathsChanged);
    EXPECT_TRUE(c.fileSystemsChanged);
    EXPECT_EQ(0, c.filesScanned);
    FS_Cache2 c2(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_STREQ("FS_Cache2", c2.className);
    glue.checksumFlags = 0x1f;
    FS_Cache c3(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_FALSE(c3.computeChecksums);
}

TEST_F(CacheTest, NullNameLeavesObjectUninitialisedAndCreateFails)
{
    FS_Cache c(nullptr, L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_FALSE(c.cacheInitialized);
    EXPECT_EQ(-53, c.create(0, FS_CACHE_CREATE));
    EXPECT_EQ(-53, c.lock());
    EXPECT_TRUE(c.close());
    EXPECT_FALSE(c.compact());
}

TEST_F(CacheTest, MutexNameReplacesColonsAndSeparators)
{
    std::string sub = dir.mkdirs("a:b");
    FS_Cache c(L"dirs", L"files", widen(sub).c_str(), false, true, &glue, L"prov");
    ASSERT_NE(nullptr, c.mutexName);
    std::wstring name = c.mutexName;
    std::wstring expected = widen(sub) + L"_c_mutex";
    for (wchar_t& ch : expected)
        if (ch == L'/' || ch == L':')
            ch = L'_';
    EXPECT_EQ(expected, name);
    EXPECT_EQ(std::wstring::npos, name.find(L'/'));
    EXPECT_EQ(std::wstring::npos, name.find(L':'));
    EXPECT_NE(std::wstring::npos, name.find(L"_a_b_c_mutex"));
}

TEST_F(CacheTest, CreateMakesTablesCounterAndFlag)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    ASSERT_EQ(0, c.create(5, FS_CACHE_CREATE));
    EXPECT_TRUE(cap.contains("FS_Cache::create - creationDisposition is FS_CACHE_CREATE"));
    EXPECT_TRUE(cap.contains("FS_Cache::create - retValue is SUCCESS"));
    EXPECT_TRUE(c.cacheOpened);
    EXPECT_NE(nullptr, c.tbFiles);
    EXPECT_NE(nullptr, c.tbDirectories);
    EXPECT_EQ(word(0), testsupport::readFile(dir.file("dirs.counter")));
    EXPECT_TRUE(testsupport::fileExists(dir.file("dirs.cuflag")));
    EXPECT_TRUE(c.insideCacheUpdate());
    EXPECT_TRUE(c.close());
    EXPECT_FALSE(testsupport::fileExists(dir.file("dirs.cuflag")));
    EXPECT_TRUE(c.cacheOpened);  // close does not clear it
}

TEST_F(CacheTest, CreateTwiceReturnsAlreadyOpenedAndKeepsCache)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    testsupport::TraceCapture cap;
    EXPECT_EQ(-51, c.create(0, FS_CACHE_OPEN));
    EXPECT_TRUE(cap.contains("FS_Cache::create - retValue is CACHE_ALREADY_OPENED!"));
    EXPECT_TRUE(c.cacheOpened);
    EXPECT_FALSE(c.cacheUnusable);
    EXPECT_NE(nullptr, c.tbFiles);
    EXPECT_TRUE(testsupport::fileExists(dir.file("dirs.cuflag")));
    c.close();
}

TEST_F(CacheTest, UnknownDispositionFails)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_EQ(-53, c.create(0, 3));
    EXPECT_FALSE(c.cacheOpened);
}

TEST_F(CacheTest, OpenAfterCleanCloseSucceedsAndReadsExcludeMarks)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        std::vector<PathInfo> none;
        c.updateMd5OfExclude(none, L"/r");
        c.close();
    }
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    EXPECT_TRUE(cap.contains("FS_Cache::openCache - cache opened!"));
    EXPECT_EQ(1u, c.excludeMd5.count("/r"));
    c.close();
}

TEST_F(CacheTest, StaleFlagRefusesOpenAndMarksUnusable)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        // no close: the flag stays as after a crash
    }
    ASSERT_TRUE(testsupport::fileExists(dir.file("dirs.cuflag")));
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN));
    EXPECT_TRUE(cap.contains("FS_Cache::openCache() - cache corrupted or directoriesIndex invalid"));
    EXPECT_TRUE(c.cacheUnusable);
    EXPECT_FALSE(c.cacheOpened);
}

TEST_F(CacheTest, StaleFlagWithOpenAlwaysStartsOver)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    }
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    EXPECT_FALSE(c.cacheUnusable);
    EXPECT_TRUE(c.cacheOpened);
    EXPECT_EQ(0u, c.directoriesIndex);
    c.close();
    EXPECT_FALSE(testsupport::fileExists(dir.file("dirs.cuflag")));
}

TEST_F(CacheTest, CheckerOffIgnoresFlag)
{
    dir.write("dirs.cuflag", "");
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, false, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_FALSE(c.insideCacheUpdate());
    EXPECT_TRUE(cap.contains("FS_Cache::insideCacheUpdate - cacheChecker disabled!"));
}

TEST_F(CacheTest, CounterAtLimitRefusesCacheBelowOpens)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        c.close();
    }
    dir.write("dirs.counter", word(0xf3333334u));
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN));
        EXPECT_TRUE(c.cacheUnusable);
    }
    dir.write("dirs.counter", word(0xf3333333u));
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_EQ(0, c.create(0, FS_CACHE_OPEN));
    EXPECT_EQ(0xf3333333u, c.directoriesIndex);
    c.close();
}

TEST_F(CacheTest, MissingOrShortCounterRefusesCache)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        c.close();
    }
    dir.write("dirs.counter", "ab");
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN));
    unlink(dir.file("dirs.counter").c_str());
    FS_Cache c2(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_EQ(-53, c2.create(0, FS_CACHE_OPEN));
    EXPECT_TRUE(c2.cacheUnusable);
}

TEST_F(CacheTest, OpenWithoutTablesFails)
{
    dir.write("dirs.counter", word(3));
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN));
    EXPECT_TRUE(cap.contains("FS_Cache::openCache - open tbFiles failed!"));
    EXPECT_EQ(nullptr, c.tbFiles);
}

TEST_F(CacheTest, CloseWhileUnusableRemovesCacheButKeepsProviderMark)
{
    std::set<std::string> before = listDir(dir.path());
    FS_Cache2 c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    std::vector<PathInfo> none;
    c.updateMd5OfExclude(none, L"/r");
    ASSERT_TRUE(c.providerHash.updateMd5OfProvider());
    dir.write("cat_set", word(1) + std::string("x\0\0\0", 4));
    ASSERT_TRUE(testsupport::fileExists(dir.file("ex_hash")));
    c.cacheUnusable = true;  // as after a build timeout
    EXPECT_TRUE(c.close());
    std::set<std::string> after = listDir(dir.path());
    // The update flag is not ended on this path: it stays, so the next open
    // refuses whatever is left and starts over.
    EXPECT_EQ((std::set<std::string>{"dirs.cuflag", "pr_hash"}), after);
}

TEST_F(CacheTest, RemoveWithoutTablesFails)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    EXPECT_FALSE(c.remove());
}

TEST_F(CacheTest, CompactOnOpenedCheckedCacheLatchesUnusable)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    EXPECT_FALSE(c.compact());
    EXPECT_TRUE(c.cacheUnusable);
}

TEST_F(CacheTest, CompactAfterCloseDropsRemovedRowsAndTheCacheOpensWhole)
{
    {
        FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        RecordSet& files = *c.filesCursor;
        for (unsigned int i = 0; i < 100; ++i) {
            files.setFieldAsString(L"FILENAME", (L"f" + std::to_wstring(i)).c_str());
            files.setFieldAsInt32(L"ATTR", 0);
            files.setFieldAsInt64(L"SIZE", i);
            files.setFieldAsInt32(L"PATHID", 1);
            files.setFieldAsString(L"MD5", L"0");
            files.setFieldAsInt32(L"CRC32", 0);
            files.setFieldAsInt32(L"Q32", 0);
            ASSERT_TRUE(files.insert());
        }
        // Remove every other row: half the stored records are dead.
        int n = 0;
        for (bool row = files.moveFirst(); row; row = files.moveNext())
            if (n++ % 2 == 0)
                files.remove();
        std::string data = dir.file("files.dat");
        long before = testsupport::readFile(data).size();
        ASSERT_TRUE(c.close());
        ASSERT_TRUE(c.compact());
        EXPECT_FALSE(c.cacheUnusable);
        EXPECT_LT(static_cast<long>(testsupport::readFile(data).size()), before);
    }
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    std::set<unsigned long long> sizes;
    for (bool row = c.filesCursor->moveFirst(); row; row = c.filesCursor->moveNext())
        sizes.insert(c.filesCursor->getFieldAsInt64(L"SIZE"));
    EXPECT_EQ(50u, sizes.size());
    EXPECT_EQ(0u, sizes.count(0));
    EXPECT_EQ(1u, sizes.count(1));
    EXPECT_EQ(1u, sizes.count(99));
    c.close();
}

TEST_F(CacheTest, CompactOnAnOpenUncheckedCacheFailsAndLatchesUnusable)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, false, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    // Open tables are not compacted.
    EXPECT_FALSE(c.compact());
    EXPECT_TRUE(c.cacheUnusable);
    c.close();
}

TEST_F(CacheTest, LockAndUnlockTraceMilestones)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.lock());
    EXPECT_TRUE(cap.contains("FS_Cache::lock - accessMutex SUCCESS!"));
    EXPECT_TRUE(cap.contains("FS_Cache::lock - exit. [retValue is 0]"));
    c.unlock();
    EXPECT_TRUE(cap.contains("FS_Cache::unlock - accessMutex RELEASED!"));
    EXPECT_EQ(0, c.lock(100));
    c.unlock();
}

TEST_F(CacheTest, SecondProcessTimesOutWhileFirstHoldsLock)
{
    int toChild[2], toParent[2];
    ASSERT_EQ(0, pipe(toChild));
    ASSERT_EQ(0, pipe(toParent));
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        FS_Cache holder(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        char ch = holder.lock() == 0 ? 'L' : 'F';
        if (write(toParent[1], &ch, 1) != 1)
            _exit(2);
        if (read(toChild[0], &ch, 1) != 1)
            _exit(3);
        holder.unlock();
        _exit(0);
    }
    char ch = 0;
    ASSERT_EQ(1, read(toParent[0], &ch, 1));
    ASSERT_EQ('L', ch);
    {
        FS_Cache waiter(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
        testsupport::TraceCapture cap;
        EXPECT_EQ(-52, waiter.lock(200));
        EXPECT_TRUE(cap.contains("FS_Cache::lock - accessMutex TIMED_OUT!"));
        ch = 'u';
        ASSERT_EQ(1, write(toChild[1], &ch, 1));
        int status = 0;
        waitpid(pid, &status, 0);
        EXPECT_EQ(0, WEXITSTATUS(status));
        EXPECT_EQ(0, waiter.lock(2000));
        waiter.unlock();
    }
    close(toChild[0]);
    close(toChild[1]);
    close(toParent[0]);
    close(toParent[1]);
}

TEST_F(CacheTest, CacheAllTakesEveryFile)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    FsQuery q;
    EXPECT_TRUE(c.isFileToBeCached(q, L"anything.txt"));
}

TEST_F(CacheTest, SelectiveCacheWithEmptySetAndNoSavedSetCachesNothing)
{
    FS_Cache2 c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    FsQuery q;
    testsupport::TraceCapture cap;
    c.saveOrRestoreFilesOrMasksForCaching(q);
    EXPECT_TRUE(cap.contains("FS_Cache2::saveOrRestoreFilesOrMasksForCaching - reloading catalog set from cache."));
    EXPECT_EQ(0u, q.getFileOrMaskForCachingSetSize());
    EXPECT_FALSE(c.isFileToBeCached(q, L"a.txt"));
}

TEST_F(CacheTest, SelectiveCacheSavesNamesThenMasksAndRestoresThem)
{
    FS_Cache2 c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    FsQuery q;
    q.addFileOrMaskForCaching(L"b.txt");
    q.addFileOrMaskForCaching(L"*.log");
    q.addFileOrMaskForCaching(L"a.txt");
    testsupport::TraceCapture cap;
    c.saveOrRestoreFilesOrMasksForCaching(q);
    EXPECT_TRUE(cap.contains("FS_Cache2::saveOrRestoreFilesOrMasksForCaching - dumping catalog set to cache."));
    auto rec = [](const std::wstring& s) {
        std::string out = word(static_cast<uint32_t>(s.size()));
        for (wchar_t ch : s)
            out += word(static_cast<uint32_t>(ch));
        return out;
    };
    EXPECT_EQ(rec(L"a.txt") + rec(L"b.txt") + rec(L"*.log"), testsupport::readFile(dir.file("cat_set")));

    FsQuery fresh;
    c.saveOrRestoreFilesOrMasksForCaching(fresh);
    EXPECT_EQ(3u, fresh.getFileOrMaskForCachingSetSize());
    EXPECT_TRUE(c.isFileToBeCached(fresh, L"a.txt"));
    EXPECT_TRUE(c.isFileToBeCached(fresh, L"x.log"));
    EXPECT_FALSE(c.isFileToBeCached(fresh, L"c.txt"));
}

TEST_F(CacheTest, DamagedCatSetRecordStopsRestoreCleanly)
{
    dir.write("cat_set", word(1) + word('a') + word(5000) + std::string(100, 'z'));
    FS_Cache2 c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    FsQuery q;
    c.saveOrRestoreFilesOrMasksForCaching(q);
    EXPECT_EQ(1u, q.getFileOrMaskForCachingSetSize());
    EXPECT_TRUE(c.isFileToBeCached(q, L"a"));
}

TEST_F(CacheTest, UnresolvableCachePathLeavesObjectUninitialised)
{
    std::wstring tooLong = L"/" + std::wstring(5000, L'x');
    testsupport::TraceCapture cap;
    FS_Cache c(L"dirs", L"files", tooLong.c_str(), false, true, &glue, L"prov");
    EXPECT_FALSE(c.cacheInitialized);
    // The derived class has not named itself yet while the base is built.
    EXPECT_TRUE(cap.contains("FS_CacheBase::FS_CacheBase - cachePathName name is NULL, pathHelper.realPath() failed!"));
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN_ALWAYS));
}

TEST_F(CacheTest, WithoutCheckerNoFlagFileIsMade)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, false, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    EXPECT_FALSE(testsupport::fileExists(dir.file("dirs.cuflag")));
    c.close();
}

// The engine never makes its directory: a host that forgot to learns so from
// a trace that names the directory, beside the one about a damaged cache.
TEST_F(CacheTest, MissingCacheDirectoryIsNamedInTheTrace)
{
    std::string missing = dir.file("not-made");
    FS_Cache c(L"dirs", L"files", widen(missing).c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN_ALWAYS));
    EXPECT_TRUE(cap.contains("FS_Cache::traceCacheDirectoryProblem - cache directory '" + missing +
                             "' does not exist: No such file or directory"));
    EXPECT_FALSE(testsupport::fileExists(missing));
}

TEST_F(CacheTest, PlainFileInPlaceOfTheCacheDirectoryIsNamedInTheTrace)
{
    std::string file = dir.write("a-file", "x");
    FS_Cache c(L"dirs", L"files", widen(file).c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN_ALWAYS));
    EXPECT_TRUE(cap.contains("FS_Cache::traceCacheDirectoryProblem - cache directory '" + file +
                             "' is not a directory"));
}

// Root may write anywhere: as root, the check runs in a child that has
// become the user "nobody" (65534).
TEST_F(CacheTest, UnwritableCacheDirectoryIsNamedInTheTrace)
{
    std::string readOnly = dir.mkdirs("read-only");
    ASSERT_EQ(0, chmod(dir.path().c_str(), 0755));
    ASSERT_EQ(0, chmod(readOnly.c_str(), 0555));
    std::string lockDir = locks.path();
    ASSERT_EQ(0, chmod(lockDir.c_str(), 0777));
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        if (geteuid() == 0 && (setgid(65534) != 0 || setuid(65534) != 0))
            _exit(3);
        FS_Cache c(L"dirs", L"files", widen(readOnly).c_str(), false, true, &glue, L"prov");
        testsupport::TraceCapture cap;
        if (c.create(0, FS_CACHE_OPEN_ALWAYS) != -53)
            _exit(4);
        _exit(cap.contains("FS_Cache::traceCacheDirectoryProblem - cache directory '" + readOnly +
                           "' is not writable: Permission denied")
                  ? 0
                  : 5);
    }
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    chmod(readOnly.c_str(), 0755);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status)) << "3: no other user, 4: create did not fail, 5: no trace";
}

// A usable directory adds no such trace, also when the open fails for
// another reason.
TEST_F(CacheTest, UsableCacheDirectoryAddsNoDirectoryTrace)
{
    FS_Cache c(L"dirs", L"files", wdir.c_str(), false, true, &glue, L"prov");
    testsupport::TraceCapture cap;
    EXPECT_EQ(-53, c.create(0, FS_CACHE_OPEN));
    EXPECT_FALSE(cap.contains("cache directory '"));
}
