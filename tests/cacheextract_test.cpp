// Extraction of hits from the cache tables: rows are filled through cursors,
// then extractResults decides per directory and writes what the paths ask for.
#include <gtest/gtest.h>

#include <unistd.h>

#include <string>
#include <vector>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cache_common.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"

namespace {

using testsupport::plainGlue;
using testsupport::widen;
std::string narrow(const wchar_t* w) { return testsupport::bytesOf(w); }

struct Hit {
    std::string path;
    std::string name;
    unsigned long long size;
    unsigned int attr;
    std::string md5;
    unsigned int crc32;
    unsigned int q32;
};

class CollectingWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                  unsigned int attr, const wchar_t* md5, unsigned int crc32,
                  unsigned int q32) override {
        hits.push_back(Hit{narrow(path), narrow(name), size, attr, narrow(md5), crc32, q32});
        return 0;
    }
    int addRecord(const FsFileInfo&) override { return -1; }
    int close() override { return 0; }
    std::vector<std::string> names() const {
        std::vector<std::string> out;
        for (const Hit& h : hits)
            out.push_back(h.path + h.name);
        return out;
    }
    std::vector<Hit> hits;
};

// A writer that takes its time over every record.
class SlowWriter : public CollectingWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                  unsigned int attr, const wchar_t* md5, unsigned int crc32,
                  unsigned int q32) override {
        usleep(30000);
        return CollectingWriter::addRecord(path, name, size, attr, md5, crc32, q32);
    }
};

// A writer that refuses every record, and counts the attempts.
class RefusingWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t*, const wchar_t*, unsigned long long, unsigned int, const wchar_t*,
                  unsigned int, unsigned int) override {
        ++attempts;
        return -1;
    }
    int addRecord(const FsFileInfo&) override { return -1; }
    int close() override { return 0; }
    int attempts = 0;
};

std::string upper(std::string s)
{
    for (char& c : s)
        if (c >= 'a' && c <= 'z')
            c = static_cast<char>(c - 'a' + 'A');
    return s;
}

struct ExtractTest : ::testing::Test {
    testsupport::TempDir locks;
    // Lock files go to a temp dir before the cache object makes any.
    bool storeSet = (LinuxSharedMutex::setStorePath(locks.path().c_str()), true);
    testsupport::TempDir cacheDir;
    testsupport::TempDir tree;
    FsGlue glue = plainGlue();
    FS_Cache cacheObject{L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov"};
    FS_Cache* cache = &cacheObject;
    __recordSet* dirCursor = nullptr;
    __recordSet* fileCursor = nullptr;
    RecordSet dirs;
    RecordSet files;
    unsigned int nextId = 1;
    std::vector<DriveInfo> drives;
    std::vector<PathDrive> roots;
    std::vector<PathInfo> includes;
    std::vector<PathInfo> excludes;
    std::string base;  // the tree's path, e.g. /tmp/xyz

    ExtractTest() {
        base = tree.path();
        while (base.size() > 1 && base.back() == '/')
            base.pop_back();
        drives.push_back(DriveInfo(L"/", dtLocal, L"ext4"));
    }
    ~ExtractTest() override {
        delete dirCursor;
        delete fileCursor;
        cache->close();
    }
    void open() {
        ASSERT_EQ(0, cache->create(0, FS_CACHE_CREATE));
        dirCursor = new __recordSet(cache->tbDirectories);
        fileCursor = new __recordSet(cache->tbFiles);
        dirs = RecordSet(dirCursor);
        files = RecordSet(fileCursor);
    }
    unsigned int addDir(const std::wstring& name, unsigned int parent) {
        unsigned int id = nextId++;
        dirs.setFieldAsInt32(L"ID", id);
        dirs.setFieldAsString(L"PATHNAME", name.c_str());
        dirs.setFieldAsInt32(L"PARENTID", parent);
        dirs.setFieldAsInt32(L"CREATIONTIME", 0);
        EXPECT_TRUE(dirs.insert());
        return id;
    }
    // Rows for every component of an absolute path; the id of the last.
    unsigned int addChain(const std::string& path) {
        unsigned int parent = addDir(L"/", 0);
        size_t pos = 1;
        while (pos < path.size()) {
            size_t next = path.find('/', pos);
            if (next == std::string::npos)
                next = path.size();
            if (next > pos)
                parent = addDir(widen(path.substr(pos, next - pos)), parent);
            pos = next + 1;
        }
        return parent;
    }
    void addFile(const std::string& name, unsigned int pathId, unsigned long long size,
                 unsigned int attr = 0x8000, const wchar_t* md5 = L"0", unsigned int crc = 0,
                 unsigned int q32 = 0) {
        files.setFieldAsString(L"FILENAME", widen(name).c_str());
        files.setFieldAsInt32(L"ATTR", attr);
        files.setFieldAsInt64(L"SIZE", size);
        files.setFieldAsInt32(L"PATHID", pathId);
        files.setFieldAsString(L"MD5", md5);
        files.setFieldAsInt32(L"CRC32", crc);
        files.setFieldAsInt32(L"Q32", q32);
        EXPECT_TRUE(files.insert());
    }
    void addRoot(const std::string& path) {
        roots.push_back(PathDrive(widen(path).c_str(), true, drives[0]));
    }
    void include(const std::string& path, bool recursive = true) {
        includes.push_back(PathInfo(widen(path).c_str(), recursive));
    }
    int extract(CollectingWriter& w, const wchar_t* query = L"[SIZE]>=0", int timeout = 100000) {
        return cache->extractResults(w, query, drives, roots, includes, excludes, files, dirs, false,
                                     timeout);
    }

    // Layout used by most tests:  <base>/data (a.txt 10, b.log 200),
    // <base>/data/sub (c.txt 300), <base>/other (d.txt 40).
    unsigned int dataId = 0, subId = 0, otherId = 0;
    void standardTree() {
        open();
        unsigned int baseId = addChain(base);
        dataId = addDir(L"data", baseId);
        subId = addDir(L"sub", dataId);
        otherId = addDir(L"other", baseId);
        addFile("a.txt", dataId, 10);
        addFile("b.log", dataId, 200);
        addFile("c.txt", subId, 300);
        addFile("d.txt", otherId, 40);
        addRoot(base + "/data");
    }
};

}  // namespace

TEST_F(ExtractTest, NoIncludedPathsReturnsZeroAndWritesNothing)
{
    standardTree();
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w));
    EXPECT_TRUE(w.hits.empty());
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - no included paths specified!"));
}

TEST_F(ExtractTest, IncludedDirectoriesAreWrittenWithTrailingSeparatorAndRowValues)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    std::vector<std::string> expected = {base + "/data/a.txt", base + "/data/b.log",
                                         base + "/data/sub/c.txt"};
    EXPECT_EQ(expected, w.names());
    ASSERT_EQ(3u, w.hits.size());
    EXPECT_EQ(base + "/data/", w.hits[0].path);
    EXPECT_EQ(10u, w.hits[0].size);
    EXPECT_EQ(0x8000u, w.hits[0].attr);
    // A cache without checksums reports "0", 0 and 0.
    EXPECT_EQ("0", w.hits[0].md5);
    EXPECT_EQ(0u, w.hits[0].crc32);
    EXPECT_EQ(0u, w.hits[0].q32);
}

TEST_F(ExtractTest, ExpressionIsAppliedByTheCursor)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w, L"[SIZE]>=100"));
    std::vector<std::string> expected = {base + "/data/b.log", base + "/data/sub/c.txt"};
    EXPECT_EQ(expected, w.names());
}

TEST_F(ExtractTest, DecisionIsMadeOncePerDirectory)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w));
    EXPECT_EQ(1u, cap.count("FS_Cache::extractResults PATH INCLUDED: '" + base + "/data'"));
    EXPECT_EQ(1u, cap.count(("FS_Cache::extractResults PATH INCLUDED: '" + base + "/data/sub'").c_str()));
    EXPECT_EQ(1u, cap.count(("FS_Cache::extractResults PATH NOT included: '" + base + "/other'").c_str()));
    EXPECT_EQ(3u, cap.count("FS_Cache::extractResults bIncludeFile=false"));
    EXPECT_TRUE(cap.contains(("FS_Cache::extractResults building excludeList for pathIndex=0 for: '" +
                              base + "/data'").c_str()));
}

TEST_F(ExtractTest, DirectoryOutsideEveryRootIsNeverReportedEvenIfIncluded)
{
    standardTree();
    include(base + "/data");
    include(base + "/other");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    for (const std::string& n : w.names())
        EXPECT_EQ(std::string::npos, n.find("d.txt")) << n;
    EXPECT_EQ(3u, w.hits.size());
}

TEST_F(ExtractTest, WithRemoteCachingTheRootTestsAreSkipped)
{
    standardTree();
    cache->cacheRemoteDrives = true;
    include(base + "/other");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    std::vector<std::string> expected = {base + "/other/d.txt"};
    EXPECT_EQ(expected, w.names());
}

TEST_F(ExtractTest, TwoQueriesWithDifferentIncludesGiveDifferentResultsFromSameRows)
{
    standardTree();
    include(base + "/data/sub");
    CollectingWriter w1;
    EXPECT_EQ(0, extract(w1));
    std::vector<std::string> first = {base + "/data/sub/c.txt"};
    EXPECT_EQ(first, w1.names());

    includes.clear();
    include(base + "/data", false);
    CollectingWriter w2;
    EXPECT_EQ(0, extract(w2));
    std::vector<std::string> second = {base + "/data/a.txt", base + "/data/b.log"};
    EXPECT_EQ(second, w2.names());
}

TEST_F(ExtractTest, ExcludedDirectoryIsNotReported)
{
    standardTree();
    include(base + "/data");
    excludes.push_back(PathInfo(widen(base + "/data/sub").c_str(), true));
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    std::vector<std::string> expected = {base + "/data/a.txt", base + "/data/b.log"};
    EXPECT_EQ(expected, w.names());
}

TEST_F(ExtractTest, TimeoutZeroReturnsScanTimedOutAtFirstMatchingRowAndWritesNothing)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-41, extract(w, L"[SIZE]>=0", 0));
    EXPECT_TRUE(w.hits.empty());
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - timed out!"));
}

TEST_F(ExtractTest, TimeoutZeroWithNoMatchingRowReturnsZero)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w, L"[SIZE]>=100000", 0));
    EXPECT_TRUE(w.hits.empty());
    EXPECT_FALSE(cap.contains("timed out!"));
}

TEST_F(ExtractTest, BrokenDirectoryChainReturnsCacheUnusable)
{
    standardTree();
    include(base + "/data");
    // Remove the row of "data": the chain of "sub" and of data's files breaks.
    bool removed = false;
    for (bool more = dirs.moveFirst(); more; more = dirs.moveNext()) {
        if (dirs.getFieldAsInt32(L"ID") == dataId) {
            removed = dirs.remove();
            break;
        }
    }
    ASSERT_TRUE(removed);
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-40, extract(w));
    EXPECT_TRUE(w.hits.empty());
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - findPathById() failed! extract interrupted!"));
}

TEST_F(ExtractTest, EmptyKnownHashesSetBehavesAsNoSet)
{
    standardTree();
    FileHashBlackBox none;
    cache->knownHashes = &none;
    include(base + "/data");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    EXPECT_EQ(3u, w.hits.size());
}

TEST_F(ExtractTest, KnownHashesFilterComputesSumsFromTheFileButReportsTheRow)
{
    open();
    tree.write("hit.txt", "hello");
    tree.write("miss.txt", "other");
    unsigned int baseId = addChain(base);
    addFile("hit.txt", baseId, 5);
    addFile("miss.txt", baseId, 5);
    addRoot(base);
    include(base);
    FileHashBlackBox wanted;
    wanted.insert_crc32(0x3610a686u);  // CRC-32 of "hello"
    cache->knownHashes = &wanted;
    cache->computeChecksums = false;
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    ASSERT_EQ(1u, w.hits.size());
    EXPECT_EQ("hit.txt", w.hits[0].name);
    // The sum computed for the filter does not reach the record.
    EXPECT_EQ(0u, w.hits[0].crc32);
    EXPECT_EQ("0", w.hits[0].md5);
}

TEST_F(ExtractTest, SymbolicLinkHasZeroSumsAndIsNotOpened)
{
    open();
    tree.write("link.txt", "hello");  // content would match, but a link is not read
    unsigned int baseId = addChain(base);
    addFile("link.txt", baseId, 5, 0x1000 | 0x8000);
    addRoot(base);
    include(base);
    FileHashBlackBox wanted;
    wanted.insert_crc32(0x3610a686u);
    cache->knownHashes = &wanted;
    cache->computeChecksums = false;
    CollectingWriter w1;
    EXPECT_EQ(0, extract(w1));
    EXPECT_TRUE(w1.hits.empty());

    // Zero sums are what find sees for it.
    FileHashBlackBox zero;
    zero.insert_crc32(0);
    cache->knownHashes = &zero;
    CollectingWriter w2;
    EXPECT_EQ(0, extract(w2));
    ASSERT_EQ(1u, w2.hits.size());
    EXPECT_EQ("link.txt", w2.hits[0].name);
}

TEST_F(ExtractTest, WithComputedChecksumsTheRowSumsAreFiltered)
{
    open();
    unsigned int baseId = addChain(base);
    // Neither file exists: only the stored sums can decide.
    addFile("stored.bin", baseId, 5, 0x8000, L"5d41402abc4b2a76b9719d911017c592", 0x3610a686u, 7);
    addFile("plain.bin", baseId, 5, 0x8000, L"0", 1, 2);
    addRoot(base);
    include(base);
    FileHashBlackBox wanted;
    wanted.insert_crc32(0x3610a686u);
    cache->knownHashes = &wanted;
    cache->computeChecksums = true;
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    ASSERT_EQ(1u, w.hits.size());
    EXPECT_EQ("stored.bin", w.hits[0].name);
    EXPECT_EQ(0x3610a686u, w.hits[0].crc32);
    EXPECT_EQ(7u, w.hits[0].q32);
    EXPECT_EQ("5d41402abc4b2a76b9719d911017c592", w.hits[0].md5);
}

TEST_F(ExtractTest, MissingFileCountsAsZeroSums)
{
    open();
    unsigned int baseId = addChain(base);
    addFile("gone.txt", baseId, 5);
    addRoot(base);
    include(base);
    FileHashBlackBox zero;
    zero.insert_crc32(0);
    cache->knownHashes = &zero;
    cache->computeChecksums = false;
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));
    ASSERT_EQ(1u, w.hits.size());
    EXPECT_EQ("gone.txt", w.hits[0].name);
}

TEST_F(ExtractTest, PerRootExcludesLeaveOutAMountOfAnotherKindBelowTheRoot)
{
    standardTree();
    // <base>/data/sub is an xfs disk below the root <base>/data on ext4.
    drives.push_back(DriveInfo(widen(base + "/data/sub:").c_str(), dtLocal, L"xfs"));
    include(base + "/data");
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w));
    std::vector<std::string> expected = {base + "/data/a.txt", base + "/data/b.log"};
    EXPECT_EQ(expected, w.names());
    EXPECT_EQ(1u, cap.count("FS_Cache::extractResults building excludeList for pathIndex=0 for: '" +
                            base + "/data'"));
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults PATH NOT included: '" + base + "/data/sub'"));

    // With remote caching the per-root test is skipped: sub is reported.
    cache->cacheRemoteDrives = true;
    CollectingWriter w2;
    EXPECT_EQ(0, extract(w2));
    std::vector<std::string> all = {base + "/data/a.txt", base + "/data/b.log",
                                    base + "/data/sub/c.txt"};
    EXPECT_EQ(all, w2.names());
}

TEST_F(ExtractTest, EachRootHasItsOwnExcludes)
{
    standardTree();
    // An nfs mount below <base>/other only.
    drives.push_back(DriveInfo(widen(base + "/other:").c_str(), dtRemote, L"nfs"));
    unsigned int deepId = addDir(L"deep", otherId);
    addFile("e.txt", deepId, 50);
    drives.push_back(DriveInfo(widen(base + "/other/deep:").c_str(), dtLocal, L"xfs"));
    addRoot(base + "/other");
    include(base + "/data");
    include(base + "/other");
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w));
    // data's rows under its own (empty) excludes, other's under its own,
    // which cut out the xfs disk below it.
    std::vector<std::string> expected = {base + "/data/a.txt", base + "/data/b.log",
                                         base + "/data/sub/c.txt", base + "/other/d.txt"};
    EXPECT_EQ(expected, w.names());
    EXPECT_TRUE(cap.contains("building excludeList for pathIndex=1 for: '" + base + "/other'"));
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults PATH NOT included: '" + base + "/other/deep'"));
}

TEST_F(ExtractTest, FirstRowWithPathIdZeroCountsAsTheSameDirectoryNotIncluded)
{
    open();
    addFile("orphan.txt", 0, 1);  // the very first row of the table
    unsigned int baseId = addChain(base);
    addFile("kept.txt", baseId, 2);
    addRoot(base);
    include(base);
    CollectingWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, extract(w));
    std::vector<std::string> expected = {base + "/kept.txt"};
    EXPECT_EQ(expected, w.names());
    // One decision only: the orphan row was no new directory.
    EXPECT_EQ(1u, cap.count("FS_Cache::extractResults bIncludeFile=false"));
    EXPECT_FALSE(cap.contains("findPathById() failed!"));
}

TEST_F(ExtractTest, CaseInsensitiveQueryGetsTheDirectoryTextAsStoredInTheCache)
{
    standardTree();
    roots.clear();
    roots.push_back(PathDrive(widen(upper(base + "/data")).c_str(), true, drives[0]));
    include(upper(base + "/DATA/SUB"));
    CollectingWriter w;
    EXPECT_EQ(0, extract(w));  // extract() asks case-insensitively
    ASSERT_EQ(1u, w.hits.size());
    EXPECT_EQ(base + "/data/sub/", w.hits[0].path);
    EXPECT_EQ("c.txt", w.hits[0].name);

    CollectingWriter strict;
    EXPECT_EQ(0, cache->extractResults(strict, L"[SIZE]>=0", drives, roots, includes, excludes,
                                       files, dirs, true, 100000));
    EXPECT_TRUE(strict.hits.empty());
}

TEST_F(ExtractTest, PathCommandGivesTheFullPathOfTheRow)
{
    standardTree();
    include(base);
    addRoot(base);
    CollectingWriter w;
    std::wstring query = widen("path([PATHID],[FILENAME])==\"" + base + "/data/sub/c.txt\"");
    EXPECT_EQ(0, extract(w, query.c_str()));
    std::vector<std::string> expected = {base + "/data/sub/c.txt"};
    EXPECT_EQ(expected, w.names());

    CollectingWriter masked;
    std::wstring wild = widen("path([PATHID],[FILENAME])==\"" + base + "/data/*.txt\"");
    EXPECT_EQ(0, extract(masked, wild.c_str()));
    std::vector<std::string> both = {base + "/data/a.txt", base + "/data/sub/c.txt"};
    EXPECT_EQ(both, masked.names());
}

TEST_F(ExtractTest, TypeCommandAsksTheFileCommandAboutTheRow)
{
    open();
    tree.write("run.sh", "#!/bin/sh\necho hello\n");
    tree.write("note.txt", "just some words\n");
    unsigned int baseId = addChain(base);
    addFile("run.sh", baseId, 21);
    addFile("note.txt", baseId, 16);
    addRoot(base);
    include(base);
    CollectingWriter w;
    EXPECT_EQ(0, extract(w, L"type(path([PATHID],[FILENAME]),\"script\")==1"));
    std::vector<std::string> expected = {base + "/run.sh"};
    EXPECT_EQ(expected, w.names());
}

TEST_F(ExtractTest, CommandsLeaveTheSharedTableWithTheExtraction)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w, L"path([PATHID],[FILENAME])==\"*\""));
    EXPECT_EQ(3u, w.hits.size());
    EXPECT_TRUE(cmdTokenTable().empty());
    // And so the cache's own lookups still parse: "pathid" is no command.
    cache->removeFiles(cache->tbFiles, dataId);
    CollectingWriter after;
    EXPECT_EQ(0, extract(after));
    std::vector<std::string> expected = {base + "/data/sub/c.txt"};
    EXPECT_EQ(expected, after.names());
}

TEST_F(ExtractTest, TimeIsCheckedAtEveryRowNotOncePerDirectory)
{
    open();
    unsigned int baseId = addChain(base);
    for (int i = 0; i < 10; ++i)
        addFile("f" + std::to_string(i), baseId, 1);
    addRoot(base);
    include(base);
    SlowWriter w;
    testsupport::TraceCapture cap;
    EXPECT_EQ(-41, extract(w, L"[SIZE]>=0", 100));
    EXPECT_GE(w.hits.size(), 1u);
    EXPECT_LT(w.hits.size(), 10u);
    EXPECT_TRUE(cap.contains("FS_Cache::extractResults - timed out!"));
}

TEST_F(ExtractTest, RefusedRecordsAreNotNoticed)
{
    standardTree();
    include(base + "/data");
    RefusingWriter w;
    EXPECT_EQ(0, cache->extractResults(w, L"[SIZE]>=0", drives, roots, includes, excludes, files,
                                       dirs, false, 100000));
    EXPECT_EQ(3, w.attempts);
}

TEST_F(ExtractTest, EmptyKnownHashesSetGivesTheSameRecordsAsNoSet)
{
    standardTree();
    include(base + "/data");
    CollectingWriter plain;
    EXPECT_EQ(0, extract(plain));
    FileHashBlackBox none;
    cache->knownHashes = &none;
    cache->computeChecksums = false;
    CollectingWriter filtered;
    EXPECT_EQ(0, extract(filtered));
    EXPECT_EQ(plain.names(), filtered.names());
}

TEST_F(ExtractTest, EmptyExpressionLeavesTheCursorUnfilteredAndEveryRowCounts)
{
    standardTree();
    include(base + "/data");
    CollectingWriter w;
    EXPECT_EQ(0, extract(w, L""));
    std::vector<std::string> expected = {base + "/data/a.txt", base + "/data/b.log",
                                         base + "/data/sub/c.txt"};
    EXPECT_EQ(expected, w.names());
    CollectingWriter none;
    EXPECT_EQ(0, cache->extractResults(none, nullptr, drives, roots, includes, excludes, files,
                                       dirs, false, 100000));
    EXPECT_EQ(expected, none.names());
}
