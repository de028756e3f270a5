// Whole queries through FS_Cache and FS_Cache2 over fixture trees: the local
// roots are built into the cache, served from it while valid, rebuilt when
// not, and the hits come out of the extraction.
#include <gtest/gtest.h>

#include <algorithm>
#include <set>
#include <string>
#include <unistd.h>
#include <vector>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "support/cachefixture.h"

namespace {

using testsupport::plainGlue;
using testsupport::widen;
using PathWriter = testsupport::HitWriter;

// Regular files as find(1) lists them; extra being more find arguments.
std::set<std::string> findFiles(const std::string& root, const std::string& extra)
{
    return testsupport::findFiles(root, "-type f " + extra);
}

struct QueryTest : ::testing::Test {
    testsupport::TempDir locks;
    bool storeSet = (LinuxSharedMutex::setStorePath(locks.path().c_str()), true);
    testsupport::TempDir cacheDir;
    testsupport::TempDir tree;
    testsupport::TempDir sys;
    testsupport::TempDir traces;
    FsGlue glue = plainGlue();
    std::string base;

    QueryTest() {
        base = tree.path();
        while (base.size() > 1 && base.back() == '/')
            base.pop_back();
        sys.write("auto.master", "");
        sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\n");
        MountTableManager::setMountTablePath(sys.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(sys.file("auto.master").c_str());
        KelCfg::setKey("common_trace_path", traces.path().c_str());
    }
    ~QueryTest() override {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
        KelCfg::removeKey("common_trace_path");
    }
    // dirs directories under <base>/<top>, each with files files of sizes
    // 1..files bytes, and one deeper level in every fifth directory.
    void makeTree(const std::string& top, int dirs, int files) {
        for (int d = 0; d < dirs; ++d) {
            std::string dir = top + "/d" + std::to_string(d);
            if (d % 5 == 0)
                dir += "/deep";
            for (int f = 0; f < files; ++f)
                tree.write(dir + "/f" + std::to_string(f) + (f % 3 == 0 ? ".log" : ".txt"),
                           std::string(static_cast<size_t>(f + 1), 'x'));
        }
    }
    std::wstring cachePath() const { return widen(cacheDir.path()); }
};

}  // namespace

TEST_F(QueryTest, FixtureTreeHitsEqualFindThroughBothCacheClasses)
{
    makeTree("big", 40, 50);  // 2000 files
    std::set<std::string> expected = findFiles(base + "/big", "-size +20c");
    ASSERT_EQ(40u * 30u, expected.size());
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        FsQuery q;
        q.setQuery(L"[SIZE]>20");
        q.addIncludePath(widen(base + "/big").c_str(), true);
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        EXPECT_EQ(expected, w.hits);
        EXPECT_EQ(expected.size(), w.records);
        EXPECT_TRUE(cap.contains("IMPORTANT: File system access on '" + base + "/big'"));
        EXPECT_TRUE(cap.contains("IMPORTANT: (OK) File system access on '" + base + "/big'"));
        EXPECT_TRUE(cap.contains("IMPORTANT: BUILDING CACHE SUMMARY - "));
        EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - exit. [retValue is 0]"));
        c.close();
    }
    testsupport::TempDir cacheDir2;
    FS_Cache2 c2(L"dirs", L"files", widen(cacheDir2.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c2.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>20");
    q.addIncludePath(widen(base + "/big/d3").c_str(), true);
    // FS_Cache2 keeps only the names of its caching set.
    q.addFileOrMaskForCaching(L"*.txt");
    PathWriter w;
    EXPECT_EQ(0, c2.executeQueryEx(w, q, 600000, 3600));
    EXPECT_EQ(findFiles(base + "/big/d3", "-size +20c -name '*.txt'"), w.hits);
    EXPECT_EQ(20u, w.hits.size());
    c2.close();
}

TEST_F(QueryTest, NewObjectOverSameCacheFilesAnswersFromCacheWithoutTouchingTree)
{
    makeTree("t", 5, 10);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    std::set<std::string> before = findFiles(base + "/t", "");
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        EXPECT_EQ(before, w.hits);
        c.close();
    }
    // Change the tree behind the cache's back.
    std::string oldName = base + "/t/d1/f1.txt";
    ASSERT_EQ(0, rename(oldName.c_str(), (base + "/t/d1/renamed.txt").c_str()));
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_EQ(before, w.hits);  // the old answer: nothing was read from disk
    EXPECT_TRUE(cap.contains("IMPORTANT: FS_Cache::executeQueryCacheOnlyEx - retrieving data from cache for '" +
                             base + "/t' (drive: '/:', type: 2, fs: 'ext4')"));
    EXPECT_FALSE(cap.contains("IMPORTANT: File system access on"));
    EXPECT_TRUE(cap.contains("(cacheValid check2) cache is valid: true"));
    EXPECT_TRUE(cap.contains("(cacheIsValid check3) cache is valid: true"));
    c.close();
}

TEST_F(QueryTest, OldCacheIsRebuiltRootByRootWithMaxCacheAgeZeroOneSecondLater)
{
    makeTree("t", 3, 4);
    makeTree("u", 2, 2);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    q.addIncludePath(widen(base + "/u").c_str(), true);
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        c.close();
    }
    tree.write("t/d0/new.txt", "n");
    tree.write("u/d1/new.txt", "n");
    sleep(1);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 0));
    // The rebuild of t sets cacheValid again; u fails the age test on its own.
    EXPECT_EQ(2u, cap.count("FS_Cache::executeQueryCacheOnlyEx - (cacheValid check2) cache is valid: false"));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - Existing tree for '" + base + "/t' in the cache is not valid. Removing it, then recreating."));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - Existing tree for '" + base + "/u' in the cache is not valid. Removing it, then recreating."));
    EXPECT_EQ(2u, cap.count("FS_Cache::executeQueryCacheOnlyEx - tree removed!"));
    EXPECT_EQ(2u, cap.count("IMPORTANT: (OK) File system access on '"));
    std::set<std::string> expected = findFiles(base + "/t", "");
    std::set<std::string> u = findFiles(base + "/u", "");
    expected.insert(u.begin(), u.end());
    EXPECT_EQ(expected, w.hits);
    EXPECT_EQ(expected.size(), w.records);
    EXPECT_EQ(1u, w.hits.count(base + "/t/d0/new.txt"));
    EXPECT_EQ(1u, w.hits.count(base + "/u/d1/new.txt"));
    c.close();
}

TEST_F(QueryTest, SummaryTextCountsEveryBuildOfTheObject)
{
    makeTree("t", 2, 2);  // 4 files; directories d0, d0/deep, d1
    makeTree("u", 1, 3);  // 3 files; directories d0, d0/deep
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    std::string logName = traces.file("traceKEL_scanned_dirs.log");
    // Either the build stayed inside one wall-clock second, or it did not.
    auto expectSummary = [&](const testsupport::TraceCapture& cap, int files, int dirs) {
        std::string counts = std::to_string(files) + " files and " + std::to_string(dirs) +
                             " directories scanned.";
        std::string log = testsupport::readFile(logName);
        if (cap.contains("Scan duration 0 seconds.")) {
            EXPECT_TRUE(cap.contains("IMPORTANT: BUILDING CACHE SUMMARY - " + counts +
                                     " Scan duration 0 seconds."));
            EXPECT_NE(std::string::npos,
                      log.find("File system scan finished - " + counts +
                               "\nScan duration 0 seconds.\n"));
        } else {
            // A loaded machine may take a second or more: t comes from the text.
            std::string head = "IMPORTANT: BUILDING CACHE SUMMARY - " + counts +
                               " Scan duration '0' hours '0' minutes '";
            std::string text;
            for (const QvLogWrapper::Message& m : cap.messages())
                if (m.text.find(head) == 0)
                    text = m.text;
            ASSERT_FALSE(text.empty()) << cap.dump();
            long t = std::stol(text.substr(head.size()));
            ASSERT_GT(t, 0);
            std::string tail = std::to_string(t) + "' seconds. " +
                               std::to_string((files + dirs) / t) + " entries per second.";
            EXPECT_EQ(head + tail, text);
            EXPECT_NE(std::string::npos,
                      log.find("File system scan finished - " + counts +
                               "\nScan duration '0' hours '0' minutes '" + tail + "\n"));
        }
        EXPECT_EQ(0u, log.find("LIST OF SCANNED DIRECTORIES DURING SOFTWARE SCAN:\n"));
    };
    {
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        expectSummary(cap, 4, 3);
    }
    // The counters are never reset: the second build's summary counts both.
    FsQuery q2;
    q2.setQuery(L"[SIZE]>=0");
    q2.addIncludePath(widen(base + "/u").c_str(), true);
    {
        PathWriter w;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, c.executeQueryEx(w, q2, 600000, 3600));
        expectSummary(cap, 7, 5);
        EXPECT_EQ(3u, w.hits.size());
    }
    EXPECT_EQ(7, c.filesScanned);
    EXPECT_EQ(5, c.directoriesScanned);
    c.close();
}

TEST_F(QueryTest, QueryThatBuildsNothingLeavesTheFolderLogAlone)
{
    makeTree("t", 1, 1);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        c.close();
    }
    std::string logName = traces.file("traceKEL_scanned_dirs.log");
    traces.write("traceKEL_scanned_dirs.log", "earlier content\n");
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_FALSE(cap.contains("BUILDING CACHE SUMMARY"));
    EXPECT_EQ("earlier content\n", testsupport::readFile(logName));
    c.close();
}

TEST_F(QueryTest, SecondIdenticalQueryOnSameObjectNeitherRescansNorChecksAge)
{
    makeTree("t", 3, 4);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w1;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 600000, 0));
    EXPECT_FALSE(c.lastMd5OfPaths.empty());
    tree.write("t/d1/late.txt", "l");
    sleep(1);
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w2, q, 600000, 0));
    EXPECT_EQ(w1.hits, w2.hits);
    EXPECT_EQ(0u, w2.hits.count(base + "/t/d1/late.txt"));
    EXPECT_FALSE(cap.contains("scanning [mdLocalDriveGroup]"));
    EXPECT_FALSE(cap.contains("cacheValid check2"));
    c.close();
}

TEST_F(QueryTest, ChangedExcludeListRebuildsTheRoot)
{
    makeTree("t", 3, 4);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        c.close();
    }
    q.addExcludePath(widen(base + "/t/d1").c_str(), true);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_TRUE(cap.contains("(cacheIsValid check3) cache is valid: false"));
    EXPECT_TRUE(cap.contains("IMPORTANT: File system access on '" + base + "/t'"));
    for (const std::string& h : w.hits)
        EXPECT_EQ(std::string::npos, h.find("/t/d1/")) << h;
    EXPECT_FALSE(w.hits.empty());
    c.close();
}

TEST_F(QueryTest, ChangedProviderRebuildsOnlyTheFirstLocalRoot)
{
    makeTree("a", 2, 3);
    makeTree("b", 2, 3);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/a").c_str(), true);
    q.addIncludePath(widen(base + "/b").c_str(), true);
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w;
        EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
        c.close();
    }
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"another");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - (cacheValid check1) previous provider differs, therefore cache is invalid."));
    EXPECT_TRUE(cap.contains("IMPORTANT: File system access on '" + base + "/a'"));
    EXPECT_FALSE(cap.contains("IMPORTANT: File system access on '" + base + "/b'"));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + base + "/b'"));
    std::set<std::string> expected = findFiles(base + "/a", "");
    std::set<std::string> b = findFiles(base + "/b", "");
    expected.insert(b.begin(), b.end());
    EXPECT_EQ(expected, w.hits);
    c.close();
}

TEST_F(QueryTest, NewCacheWithoutProviderMarkIsInvalidAndBuilds)
{
    makeTree("t", 1, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_TRUE(cap.contains("(cacheValid check1) unable to determine previous provider, therefore cache is invalid."));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("pr_hash")));
    EXPECT_EQ(2u, w.hits.size());
    c.close();
}

TEST_F(QueryTest, SummaryGoesToFolderLog)
{
    makeTree("t", 2, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_EQ(nullptr, c.folderLog);  // closed after the visits
    std::string logText = testsupport::readFile(traces.file("traceKEL_scanned_dirs.log"));
    EXPECT_NE(std::string::npos, logText.find("File system scan finished - "));
    EXPECT_NE(std::string::npos, logText.find(" files and "));
    c.close();
}

TEST_F(QueryTest, BuildTimeoutLatchesAndCloseErasesTheCache)
{
    makeTree("t", 2, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-42, c.executeQueryEx(w, q, 0, 3600));
    EXPECT_TRUE(cap.contains("IMPORTANT: (TIMEOUT) File system access on '" + base + "/t' (drive: '/:', type: 2, fs: 'ext4')"));
    EXPECT_FALSE(cap.contains("BUILDING CACHE SUMMARY"));
    EXPECT_FALSE(cap.contains("executeQueryCacheOnlyEx - exit."));
    EXPECT_TRUE(w.hits.empty());
    EXPECT_TRUE(c.cacheUnusable);
    // The failed first query changed nothing of the query memory, and left
    // the folder log open.
    EXPECT_TRUE(c.firstQuery);
    EXPECT_TRUE(c.lastMd5OfPaths.empty());
    EXPECT_NE(nullptr, c.folderLog);
    // The tree stays as far as it got, with a fresh stamp and no digest.
    {
        RecordSet dirs = c.tbDirectories->openRecordSet();
        dirs.setCriteria(nullptr, true);
        bool rootFound = false;
        for (bool more = dirs.moveFirst(); more; more = dirs.moveNext()) {
            wchar_t const* name = dirs.getFieldAsString(L"PATHNAME");
            if (name != nullptr && std::wstring(name) == L"t") {
                rootFound = true;
                EXPECT_NE(0u, dirs.getFieldAsInt32(L"CREATIONTIME"));
            }
        }
        c.tbDirectories->closeRecordSet(dirs);
        EXPECT_TRUE(rootFound);
        EXPECT_EQ(std::string::npos, testsupport::readFile(cacheDir.file("ex_hash")).find("/t"));
    }
    PathWriter w2;
    testsupport::TraceCapture cap2;
    EXPECT_EQ(-40, c.executeQueryEx(w2, q, 600000, 3600));
    // Nothing but the entry's own trace: no throttle, no drive list, no visit.
    ASSERT_EQ(1u, cap2.messages().size()) << cap2.dump();
    EXPECT_TRUE(cap2.contains("FS_Cache::executeQueryEx called with: query: '[SIZE]>=0', timeout=600000, maxCacheAge=3600"));
    EXPECT_TRUE(w2.hits.empty());
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("files.dat")));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("pr_hash")));
    c.close();
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("files.dat")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("dirs.dat")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("dirs.counter")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("ex_hash")));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("pr_hash")));
}

TEST_F(QueryTest, ExtractionTimeoutDoesNotLatch)
{
    makeTree("t", 2, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w1;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 600000, 3600));
    // Same paths: the visits are skipped and the zero budget hits the extraction.
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-41, c.executeQueryEx(w2, q, 0, 3600));
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - timed out!"));
    EXPECT_FALSE(c.cacheUnusable);
    PathWriter w3;
    EXPECT_EQ(0, c.executeQueryEx(w3, q, 600000, 3600));
    EXPECT_EQ(w1.hits, w3.hits);
    c.close();
}

TEST_F(QueryTest, BrokenDirectoryChainLatchesCacheUnusableAndCloseErasesIt)
{
    makeTree("t", 2, 2);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    {
        FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        PathWriter w1;
        EXPECT_EQ(0, c.executeQueryEx(w1, q, 600000, 3600));
        EXPECT_EQ(4u, w1.hits.size());
        // Remove the row of "d1" through a cursor: its files lose their chain.
        RecordSet dirs = c.tbDirectories->openRecordSet();
        dirs.setCriteria(nullptr, true);
        bool removed = false;
        for (bool more = dirs.moveFirst(); more; more = dirs.moveNext()) {
            wchar_t const* name = dirs.getFieldAsString(L"PATHNAME");
            if (name != nullptr && std::wstring(name) == L"d1") {
                removed = dirs.remove();
                break;
            }
        }
        c.tbDirectories->closeRecordSet(dirs);
        ASSERT_TRUE(removed);
        c.close();
    }
    // A new object (its path memo knows nothing) serves the tree from the
    // cache and cannot rebuild the path of d1's files.
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-40, c.executeQueryEx(w2, q, 600000, 3600));
    EXPECT_TRUE(cap.contains("retrieving data from cache for '" + base + "/t'"));
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - findPathById() failed! extract interrupted!"));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - exit. [retValue is -40]"));
    EXPECT_TRUE(c.cacheUnusable);
    PathWriter w3;
    EXPECT_EQ(-40, c.executeQueryEx(w3, q, 600000, 3600));
    EXPECT_TRUE(w3.hits.empty());
    c.close();
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("files.dat")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("dirs.dat")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("dirs.counter")));
    EXPECT_FALSE(testsupport::fileExists(cacheDir.file("ex_hash")));
    EXPECT_TRUE(testsupport::fileExists(cacheDir.file("pr_hash")));
}

TEST_F(QueryTest, FirstTimeOnlySecondQueryOnlyReadsTheCache)
{
    makeTree("t", 2, 2);
    makeTree("u", 1, 1);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.setFirstTimeOnly(true);
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w1;
    EXPECT_EQ(0, c.executeQueryEx(w1, q, 600000, 3600));
    EXPECT_EQ(4u, w1.hits.size());
    FsQuery q2;
    q2.setQuery(L"[SIZE]>=0");
    q2.setFirstTimeOnly(true);
    q2.addIncludePath(widen(base + "/u").c_str(), true);
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w2, q2, 600000, 3600));
    // The paths of the first query still decide.
    EXPECT_EQ(w1.hits, w2.hits);
    EXPECT_FALSE(cap.contains("scanning [mdLocalDriveGroup]"));
    c.close();
}

TEST_F(QueryTest, RemoteMountIsWalkedDirectlyBesideCachedLocalRoot)
{
    makeTree("t", 2, 2);
    std::string remote = tree.mkdirs("remote");
    tree.write("remote/r.txt", "rrrr");
    sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\nsrv:/export " + remote + " nfs rw 0 0\n");
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    q.addIncludePath(widen("$remote::" + remote).c_str(), true);
    PathWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    EXPECT_EQ(1u, w.hits.count(remote + "/r.txt"));
    EXPECT_EQ(5u, w.hits.size()) << cap.dump();
    EXPECT_TRUE(cap.contains("scanning [mdRemoteDriveGroup] and [mdOtherDriveGroup] [" + remote));
    EXPECT_TRUE(cap.contains("scanning [mdLocalDriveGroup] [" + base + "/t]"));
    c.close();
}

TEST_F(QueryTest, RebuildOnTheSameObjectAfterAnExtractionRemovesTheOldFileRows)
{
    makeTree("t", 3, 4);
    makeTree("u", 1, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    PathWriter w1;
    ASSERT_EQ(0, c.executeQueryEx(w1, q, 600000, 3600));
    ASSERT_EQ(findFiles(base + "/t", ""), w1.hits);

    // Other paths, and the tree of t is too old by now: it is removed, file
    // rows and all, and written again by the same object.
    sleep(1);
    tree.write("t/d1/later.txt", "later");
    FsQuery q2;
    q2.setQuery(L"[SIZE]>=0");
    q2.addIncludePath(widen(base + "/t").c_str(), true);
    q2.addIncludePath(widen(base + "/u").c_str(), true);
    PathWriter w2;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, c.executeQueryEx(w2, q2, 600000, 0));
    EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - tree removed!"));
    std::set<std::string> expected = findFiles(base + "/t", "");
    std::set<std::string> u = findFiles(base + "/u", "");
    expected.insert(u.begin(), u.end());
    EXPECT_EQ(expected, w2.hits);
    EXPECT_EQ(expected.size(), w2.records);
    EXPECT_FALSE(c.cacheUnusable);
    c.close();
}

TEST_F(QueryTest, PathDigestIsRememberedOnlyForQueriesThatHaveOne)
{
    makeTree("t", 1, 2);
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/t").c_str(), true);
    q.addExcludePath(widen(base + "/t/none").c_str(), true);
    PathWriter w;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    std::string digest;
    c.getMd5OfPaths(q.getIncludedPaths(), q.getExcludedPaths(), digest);
    EXPECT_EQ(32u, digest.size());
    EXPECT_EQ(digest, c.lastMd5OfPaths);

    // A path with a media word of "all" has no digest: the roots are visited
    // at every query, and the digest of the last query stays.
    FsQuery all;
    all.setQuery(L"[SIZE]>=0");
    all.addIncludePath(widen("$all::" + base + "/t").c_str(), true);
    for (int round = 0; round < 2; ++round) {
        PathWriter wa;
        testsupport::TraceCapture cap;
        EXPECT_EQ(0, c.executeQueryEx(wa, all, 600000, 3600));
        EXPECT_TRUE(cap.contains("FS_Cache::executeQueryCacheOnlyEx - scanning [mdLocalDriveGroup] [" + base + "/t] path..."));
        EXPECT_EQ(2u, wa.hits.size());
        EXPECT_EQ(digest, c.lastMd5OfPaths);
    }
    c.close();
}

TEST_F(QueryTest, KnownChecksumsFilterRealFilesAndNeverOpenALink)
{
    tree.write("k/hello.txt", "hello");
    tree.write("k/other.txt", "other");
    ASSERT_EQ(0, symlink((base + "/k/hello.txt").c_str(), (base + "/k/link.txt").c_str()));
    FileHashBlackBox wanted;
    wanted.insert_crc32(0x3610a686u);  // CRC-32 of "hello"
    glue.knownHashes = &wanted;
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/k").c_str(), true);
    PathWriter w;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    std::set<std::string> expected = {base + "/k/hello.txt"};
    EXPECT_EQ(expected, w.hits);
    c.close();

    // A set of zero sums picks the link, whose sums are never computed.
    FileHashBlackBox zero;
    zero.insert_crc32(0);
    glue.knownHashes = &zero;
    FS_Cache c2(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c2.create(0, FS_CACHE_OPEN));
    PathWriter w2;
    EXPECT_EQ(0, c2.executeQueryEx(w2, q, 600000, 3600));
    std::set<std::string> link = {base + "/k/link.txt"};
    EXPECT_EQ(link, w2.hits);
    c2.close();
}

TEST_F(QueryTest, ChecksumsOfTheScanDecideWhenTheCacheKeepsThem)
{
    tree.write("k/hello.txt", "hello");
    tree.write("k/other.txt", "other");
    FileHashBlackBox wanted;
    wanted.insert_crc32(0x3610a686u);
    glue.knownHashes = &wanted;
    glue.checksumFlags = 0x20;  // scans compute checksums
    FS_Cache c(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    ASSERT_TRUE(c.computeChecksums);
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(base + "/k").c_str(), true);
    PathWriter w;
    EXPECT_EQ(0, c.executeQueryEx(w, q, 600000, 3600));
    std::set<std::string> expected = {base + "/k/hello.txt"};
    EXPECT_EQ(expected, w.hits);
    c.close();

    // The stored sums answer even after the content changed on disk.
    tree.write("k/hello.txt", "changed");
    tree.write("k/other.txt", "hello");
    FS_Cache c2(L"dirs", L"files", cachePath().c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c2.create(0, FS_CACHE_OPEN));
    PathWriter w2;
    EXPECT_EQ(0, c2.executeQueryEx(w2, q, 600000, 3600));
    EXPECT_EQ(expected, w2.hits);
    c2.close();
}
