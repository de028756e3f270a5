// The statistics record of a query: what the direct walk, the cache scan and
// a whole query through a cache object report in it, above all the entries
// they leave out (an unreadable directory, a name the locale cannot convert
// with everything below it, a path past the limit), over fixture trees in
// temporary directories.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <functional>
#include <new>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/querystats.h"
#include "support/cachefixture.h"

namespace {

using testsupport::TempDir;
using testsupport::plainGlue;
using testsupport::widen;

const int kBudget = 2000000000;
const wchar_t* const kEveryFile = L"[SIZE]>=0";
const uid_t kNobody = 65534;

std::string trimmed(const std::string& path)
{
    std::string out = path;
    while (out.size() > 1 && out.back() == '/')
        out.pop_back();
    return out;
}

// The record as one line: counts, then the kept paths of each cause sorted
// (the walks meet entries in readdir order), with their errors.
std::string describe(const FsQueryStatistics& r)
{
    std::ostringstream out;
    out << "roots " << r.rootsFromCache << "/" << r.rootsRebuilt << "/" << r.rootsWalked
        << " files " << r.filesScanned << " dirs " << r.directoriesScanned << " hits " << r.hits;
    const char* names[] = {"unreadable", "undecodable", "too long", "no status"};
    for (int cause = 0; cause < FsQueryStatistics::SKIP_CAUSES; ++cause) {
        const FsQueryStatistics::SkippedEntries& s = r.skipped[cause];
        std::vector<std::string> kept;
        for (size_t i = 0; i < s.paths.size(); ++i)
            kept.push_back(s.paths[i] + (s.errors[i] != 0 ? " (" + std::string(strerror(s.errors[i])) + ")" : ""));
        std::sort(kept.begin(), kept.end());
        out << " | " << names[cause] << " " << s.count;
        for (const std::string& k : kept)
            out << " [" << k << "]";
    }
    return out.str();
}

// Makes a chain of directories below base whose full path has exactly length
// characters; returns it and counts the directories made in levels.
std::string deepDirectory(const std::string& base, size_t length, int& levels)
{
    std::string path = base;
    levels = 0;
    while (path.size() < length) {
        size_t room = length - path.size() - 1;
        size_t part = std::min<size_t>(200, room);
        if (room > 200 && room - 200 < 2)
            part = room - 2;
        path += "/" + std::string(part, 'd');
        if (mkdir(path.c_str(), 0755) == 0)
            ++levels;
    }
    return path;
}

// The fixture tree, as the walks see it from the C locale:
//   a.txt, sub/b.txt                      read as usual
//   lat1\xe9                              a file the locale cannot name
//   dir\xff/below1.txt, below2.txt        a directory it cannot name
//   <chain of 4080 characters>/ok.txt     read as usual
//   <chain>/<20 x's>                      a file past the limit of 4095
//   <chain>/<20 y's>/under                a directory past it, and a file
// and, with withLocked, locked/hidden.txt in a directory of mode 000.
struct Tree {
    TempDir dir;
    std::string root;
    std::string chain;
    int chainLevels = 0;

    explicit Tree(bool withLocked)
    {
        root = trimmed(dir.path());
        dir.write("a.txt", "a");
        dir.write("sub/b.txt", "bb");
        dir.write("lat1\xe9", "x");
        dir.write("dir\xff/below1.txt", "1");
        dir.write("dir\xff/below2.txt", "2");
        chain = deepDirectory(root, 4080, chainLevels);
        dir.write(chain.substr(root.size() + 1) + "/ok.txt", "ok");
        int chainFd = open(chain.c_str(), O_RDONLY | O_DIRECTORY);
        EXPECT_GE(chainFd, 0);
        int fd = openat(chainFd, std::string(20, 'x').c_str(), O_CREAT | O_WRONLY, 0644);
        EXPECT_GE(fd, 0);
        close(fd);
        EXPECT_EQ(0, mkdirat(chainFd, std::string(20, 'y').c_str(), 0755));
        int deeper = openat(chainFd, std::string(20, 'y').c_str(), O_RDONLY | O_DIRECTORY);
        EXPECT_GE(deeper, 0);
        fd = openat(deeper, "under", O_CREAT | O_WRONLY, 0644);
        EXPECT_GE(fd, 0);
        close(fd);
        close(deeper);
        close(chainFd);
        if (withLocked) {
            dir.write("locked/hidden.txt", "h");
            EXPECT_EQ(0, chmod((root + "/locked").c_str(), 0));
        }
    }
    std::string tooLongFile() const { return chain + "/" + std::string(20, 'x'); }
    std::string tooLongDirectory() const { return chain + "/" + std::string(20, 'y'); }
};

// Collects full paths of hits.
using HitWriter = testsupport::HitWriter;

// Runs body as an unprivileged user when this test runs as root (whose reads
// no permission stops) and gives back its text; in this process otherwise.
// False when the privileges cannot be dropped.  Whatever the body reads or
// writes must belong to that user (see giveAway).
bool runUnprivileged(const std::function<std::string()>& body, std::string& text)
{
    if (geteuid() != 0) {
        text = body();
        return true;
    }
    int channel[2];
    if (pipe(channel) != 0)
        return false;
    pid_t child = fork();
    if (child < 0)
        return false;
    if (child == 0) {
        close(channel[0]);
        if (setgid(kNobody) != 0 || setuid(kNobody) != 0)
            _exit(100);
        std::string result = body();
        size_t done = 0;
        while (done < result.size()) {
            ssize_t n = write(channel[1], result.data() + done, result.size() - done);
            if (n <= 0)
                _exit(101);
            done += static_cast<size_t>(n);
        }
        _exit(0);
    }
    close(channel[1]);
    text.clear();
    char buffer[4096];
    ssize_t n;
    while ((n = read(channel[0], buffer, sizeof buffer)) > 0)
        text.append(buffer, static_cast<size_t>(n));
    close(channel[0]);
    int status = 0;
    waitpid(child, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// Hands a fixture directory to the unprivileged user of runUnprivileged.
void giveAway(const std::string& path)
{
    if (geteuid() == 0)
        testsupport::runCommand("chown -R " + std::to_string(kNobody) + ":" + std::to_string(kNobody) +
                                " '" + path + "'");
}

std::string walkDirectly(const std::string& root, FsQueryStatistics& record, HitWriter& writer)
{
    FileProcessor processor(kEveryFile, true);
    PathDrive drive(widen(root).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    std::vector<PathInfo> includes, excludes;
    int rc = fs_build(writer, processor, drive, includes, excludes, true, kBudget, &record);
    return "rc " + std::to_string(rc) + " " + describe(record);
}

}  // namespace

// ------------------------------------------------------------ direct walk

TEST(QueryStatisticsOfTheDirectWalk, CountsUndecodableNamesAndPathsPastTheLimitAndWhatItRead)
{
    Tree tree(false);
    FsQueryStatistics record;
    HitWriter writer;
    std::string got = walkDirectly(tree.root, record, writer);
    // Files offered: a.txt, sub/b.txt, ok.txt.  Directories entered: sub and
    // the chain; the one past the limit and the undecodable one are not.
    std::string want = "rc 0 roots 0/0/0 files 3 dirs " + std::to_string(1 + tree.chainLevels) +
                       " hits 3 | unreadable 0 | undecodable 2 [" + tree.root + "/dir\xff] [" +
                       tree.root + "/lat1\xe9] | too long 2 [" + tree.tooLongFile() + "] [" +
                       tree.tooLongDirectory() + "] | no status 0";
    EXPECT_EQ(want, got);
    EXPECT_EQ(3u, writer.records);
    EXPECT_EQ(record.filesScanned + record.directoriesScanned, record.entriesScanned());
    EXPECT_EQ(4, record.skippedTotal());
    EXPECT_EQ(FsQueryStatistics::LOOKUP_NONE, record.lookup);
}

TEST(QueryStatisticsOfTheDirectWalk, AddsToTheRecordItIsGivenAndTheFormWithoutOneWritesTheSame)
{
    Tree tree(false);
    FsQueryStatistics record;
    HitWriter first, second, plain;
    walkDirectly(tree.root + "/sub", record, first);
    walkDirectly(tree.root + "/sub", record, second);
    EXPECT_EQ(2, record.filesScanned);
    EXPECT_EQ(2, record.hits);
    EXPECT_EQ(0, record.skippedTotal());

    FileProcessor processor(kEveryFile, true);
    PathDrive drive(widen(tree.root).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(0, fs_build(plain, processor, drive, includes, excludes, true, kBudget));
    HitWriter counted;
    FsQueryStatistics other;
    walkDirectly(tree.root, other, counted);
    EXPECT_EQ(plain.hits, counted.hits);
}

TEST(QueryStatisticsOfTheDirectWalk, KeepsOnlyTheFirstPathsOfACauseAndCountsTheRest)
{
    TempDir dir;
    std::string root = trimmed(dir.path());
    for (int i = 0; i < 8; ++i)
        dir.write("bad" + std::to_string(i) + "\xe9", "x");
    FsQueryStatistics record;
    HitWriter writer;
    walkDirectly(root, record, writer);
    const FsQueryStatistics::SkippedEntries& s = record.skipped[FsQueryStatistics::SKIP_UNDECODABLE_NAME];
    EXPECT_EQ(8, s.count);
    EXPECT_EQ(FsQueryStatistics::KEPT_PATHS, s.paths.size());
    EXPECT_EQ(s.paths.size(), s.errors.size());
}

TEST(QueryStatisticsOfTheDirectWalk, CountsAnUnreadableDirectoryWithItsErrorAndGoesOn)
{
    Tree tree(true);
    giveAway(tree.root);
    std::string got;
    ASSERT_TRUE(runUnprivileged(
        [&] {
            FsQueryStatistics record;
            HitWriter writer;
            walkDirectly(tree.root, record, writer);
            const FsQueryStatistics::SkippedEntries& s =
                record.skipped[FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY];
            std::string text = std::to_string(s.count);
            for (size_t i = 0; i < s.paths.size(); ++i)
                text += " [" + s.paths[i] + " " + std::to_string(s.errors[i]) + "]";
            return text + " hits " + std::to_string(writer.records);
        },
        got))
        << "cannot drop privileges";
    EXPECT_EQ("1 [" + tree.root + "/locked " + std::to_string(EACCES) + "] hits 3", got);
}

TEST(QueryStatisticsOfTheDirectWalk, CountsEntriesWhoseStatusIsRefusedWithTheirError)
{
    // A directory that may be listed but not searched: its entries have no
    // status, go on as files of size 0, and nothing below them is read.
    TempDir dir;
    std::string root = trimmed(dir.path());
    dir.write("listonly/file.c", "c");
    dir.write("listonly/inner/deeper.c", "d");
    ASSERT_EQ(0, chmod((root + "/listonly").c_str(), 0644));
    giveAway(root);
    std::string got;
    ASSERT_TRUE(runUnprivileged(
        [&] {
            FsQueryStatistics record;
            HitWriter writer;
            std::string text = walkDirectly(root, record, writer);
            for (const std::string& hit : writer.hits)
                text += " {" + hit + "}";
            return text;
        },
        got))
        << "cannot drop privileges";
    std::string denied = " (" + std::string(strerror(EACCES)) + ")";
    EXPECT_EQ("rc 0 roots 0/0/0 files 2 dirs 1 hits 2 | unreadable 0 | undecodable 0 | too long 0 | no status 2 [" +
                  root + "/listonly/file.c" + denied + "] [" + root + "/listonly/inner" + denied + "] {" + root +
                  "/listonly/file.c} {" + root + "/listonly/inner}",
              got);
}

// ------------------------------------------------------------- cache scan

namespace {

// A cache object over a cache directory of its own, with the machine's seams
// (mount table, automounter master, locks, traces) in temporary directories.
struct CacheFixture {
    testsupport::MachineFixture machine;
    TempDir cacheDir;
    FsGlue glue = plainGlue();

    std::wstring cachePath() const { return widen(cacheDir.path()); }
    int build(FS_CacheBase& cache, const std::string& root)
    {
        FsQuery query;
        DriveInfo drive(L"/:", dtLocal, L"ext4");
        PathDrive pathDrive(widen(root).c_str(), true, drive);
        std::vector<PathInfo> includes, excludes;
        return cache.build(query, pathDrive, *cache.directoriesCursor, cache.directoriesIndex,
                           *cache.filesCursor, *cache.directoriesCursor2, includes, excludes, true,
                           60000);
    }
};

void everyFileBelow(FsQuery& query, const std::string& root)
{
    query.setQuery(kEveryFile);
    query.addIncludePath(widen(root).c_str(), true);
}

}  // namespace

TEST(QueryStatisticsOfTheCacheScan, CountsWhatTheBuildSkippedAndRead)
{
    Tree tree(false);
    CacheFixture f;
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_CREATE));
    EXPECT_EQ(0, f.build(cache, tree.root));
    // Files: a.txt, sub/b.txt, ok.txt, and both entries past the limit, which
    // the scan stores as files without status.
    std::string want = "roots 0/0/0 files 5 dirs " + std::to_string(1 + tree.chainLevels) +
                       " hits 0 | unreadable 0 | undecodable 2 [" + tree.root + "/dir\xff] [" +
                       tree.root + "/lat1\xe9] | too long 2 [" + tree.tooLongFile() + "] [" +
                       tree.tooLongDirectory() + "] | no status 0";
    EXPECT_EQ(want, describe(cache.lastQueryStatistics()));
    // The public counters go on as before.
    EXPECT_EQ(5, cache.filesScanned);
    EXPECT_EQ(1 + tree.chainLevels, cache.directoriesScanned);
    cache.close();
}

TEST(QueryStatisticsOfTheCacheScan, DotEntriesOfADirectoryAtTheLimitAreNotCounted)
{
    // In a directory of 4093 characters, ".." has a path of 4096 bytes that
    // the system refuses; it is no entry of its own and is not counted.
    TempDir dir;
    std::string root = trimmed(dir.path());
    int levels = 0;
    std::string deep = deepDirectory(root, 4093, levels);
    ASSERT_EQ(4093u, deep.size());
    int deepFd = open(deep.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(deepFd, 0);
    int fd = openat(deepFd, "f", O_CREAT | O_WRONLY, 0644);  // 4095 characters: read as usual
    ASSERT_GE(fd, 0);
    close(fd);
    close(deepFd);
    CacheFixture f;
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_CREATE));
    EXPECT_EQ(0, f.build(cache, root));
    EXPECT_EQ(0, cache.lastQueryStatistics().skippedTotal()) << describe(cache.lastQueryStatistics());
    cache.close();
}

TEST(QueryStatisticsOfTheCacheScan, CountsEntriesWhoseStatusIsRefusedWithTheirError)
{
    TempDir dir;
    std::string root = trimmed(dir.path());
    dir.write("listonly/file.c", "c");
    dir.write("listonly/inner/deeper.c", "d");
    ASSERT_EQ(0, chmod((root + "/listonly").c_str(), 0644));
    CacheFixture f;
    giveAway(root);
    giveAway(f.cacheDir.path());
    giveAway(f.machine.locks.path());
    giveAway(f.machine.traces.path());
    std::string got;
    ASSERT_TRUE(runUnprivileged(
        [&] {
            FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
            if (cache.create(0, FS_CACHE_CREATE) != 0)
                return std::string("create failed");
            int rc = f.build(cache, root);
            std::string text = "rc " + std::to_string(rc) + " " + describe(cache.lastQueryStatistics());
            cache.close();
            return text;
        },
        got))
        << "cannot drop privileges";
    std::string denied = " (" + std::string(strerror(EACCES)) + ")";
    // Files: file.c and inner, stored without status, and "." and "..",
    // which the scan, without their status either, takes for files too; the
    // dots are no entries of their own and are not counted as skipped.
    EXPECT_EQ("rc 0 roots 0/0/0 files 4 dirs 1 hits 0 | unreadable 0 | undecodable 0 | too long 0 | no status 2 [" +
                  root + "/listonly/file.c" + denied + "] [" + root + "/listonly/inner" + denied + "]",
              got);
}

TEST(QueryStatisticsOfTheCacheScan, CountsAnUnreadableDirectoryWithItsError)
{
    Tree tree(true);
    CacheFixture f;
    giveAway(tree.root);
    giveAway(f.cacheDir.path());
    giveAway(f.machine.locks.path());
    giveAway(f.machine.traces.path());
    std::string got;
    ASSERT_TRUE(runUnprivileged(
        [&] {
            FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
            if (cache.create(0, FS_CACHE_CREATE) != 0)
                return std::string("create failed");
            int rc = f.build(cache, tree.root);
            const FsQueryStatistics::SkippedEntries& s =
                cache.lastQueryStatistics().skipped[FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY];
            std::string text = "rc " + std::to_string(rc) + " " + std::to_string(s.count);
            for (size_t i = 0; i < s.paths.size(); ++i)
                text += " [" + s.paths[i] + " " + std::to_string(s.errors[i]) + "]";
            cache.close();
            return text;
        },
        got))
        << "cannot drop privileges";
    EXPECT_EQ("rc 0 1 [" + tree.root + "/locked " + std::to_string(EACCES) + "]", got);
}

// ------------------------------------------------------------ whole queries

TEST(QueryStatisticsOfAQuery, BuildIsRecordedThenANewObjectIsServedFromTheCacheWithNothingSkipped)
{
    Tree tree(false);
    CacheFixture f;
    FsQuery query;
    everyFileBelow(query, tree.root);
    {
        FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
        ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
        HitWriter writer;
        ASSERT_EQ(0, cache.executeQueryEx(writer, query, 600000, 3600));
        const FsQueryStatistics& r = cache.lastQueryStatistics();
        std::string want = "roots 0/1/0 files 5 dirs " + std::to_string(1 + tree.chainLevels) +
                           " hits 5 | unreadable 0 | undecodable 2 [" + tree.root + "/dir\xff] [" +
                           tree.root + "/lat1\xe9] | too long 2 [" + tree.tooLongFile() + "] [" +
                           tree.tooLongDirectory() + "] | no status 0";
        EXPECT_EQ(want, describe(r));
        EXPECT_EQ(writer.records, static_cast<size_t>(r.hits));
        EXPECT_EQ(FsQueryStatistics::LOOKUP_EVERY_ROW, r.lookup);
        EXPECT_EQ(r.filesScanned + r.directoriesScanned, r.entriesScanned());
        cache.close();
    }
    FS_Cache again(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, again.create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter writer;
    ASSERT_EQ(0, again.executeQueryEx(writer, query, 600000, 3600));
    EXPECT_EQ("roots 1/0/0 files 0 dirs 0 hits 5 | unreadable 0 | undecodable 0 | too long 0 | no status 0",
              describe(again.lastQueryStatistics()));
    EXPECT_EQ(0, again.lastQueryStatistics().entriesScanned());
    again.close();
}

TEST(QueryStatisticsOfAQuery, ExactNameIsAnsweredThroughTheIndexOnFilename)
{
    Tree tree(false);
    CacheFixture f;
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery query;
    query.setQuery(L"[FILENAME]==\"b.txt\"");
    query.addIncludePath(widen(tree.root).c_str(), true);
    HitWriter writer;
    ASSERT_EQ(0, cache.executeQueryEx(writer, query, 600000, 3600));
    const FsQueryStatistics& r = cache.lastQueryStatistics();
    EXPECT_EQ(FsQueryStatistics::LOOKUP_INDEX, r.lookup);
    EXPECT_EQ(L"FILENAME", r.indexColumn);
    EXPECT_EQ(1, r.hits);
    EXPECT_EQ((std::set<std::string>{tree.root + "/sub/b.txt"}), writer.hits);
    cache.close();
}

TEST(QueryStatisticsOfAQuery, NextQueryStartsFromAnEmptyRecord)
{
    Tree tree(false);
    CacheFixture f;
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter first;
    FsQuery whole;
    everyFileBelow(whole, tree.root);
    ASSERT_EQ(0, cache.executeQueryEx(first, whole, 600000, 3600));
    ASSERT_EQ(4, cache.lastQueryStatistics().skippedTotal());

    TempDir other;
    other.write("only.txt", "o");
    HitWriter second;
    FsQuery small;
    everyFileBelow(small, trimmed(other.path()));
    ASSERT_EQ(0, cache.executeQueryEx(second, small, 600000, 3600));
    EXPECT_EQ("roots 0/1/0 files 1 dirs 0 hits 1 | unreadable 0 | undecodable 0 | too long 0 | no status 0",
              describe(cache.lastQueryStatistics()));
    // The public counters are never reset: they hold both queries.
    EXPECT_EQ(6, cache.filesScanned);
    cache.close();
}

TEST(QueryStatisticsOfAQuery, RemoteRootIsWalkedDirectlyWithItsSkippedEntriesAndHits)
{
    TempDir dir;
    std::string root = trimmed(dir.path());
    dir.write("remote/r.txt", "r");
    dir.write("remote/deeper/s.txt", "s");
    dir.write("remote/odd\xe9", "x");
    CacheFixture f;
    f.machine.sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\nsrv:/export " + root + "/remote nfs rw 0 0\n");
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter writer;
    FsQuery query;
    everyFileBelow(query, "$remote::" + root + "/remote");
    ASSERT_EQ(0, cache.executeQueryEx(writer, query, 600000, 3600));
    EXPECT_EQ("roots 0/0/1 files 2 dirs 1 hits 2 | unreadable 0 | undecodable 1 [" + root +
                  "/remote/odd\xe9] | too long 0 | no status 0",
              describe(cache.lastQueryStatistics()));
    EXPECT_EQ(2u, writer.records);
    cache.close();
}

TEST(QueryStatisticsOfAQuery, QueryRefusedAtOnceLeavesAnEmptyRecord)
{
    Tree tree(false);
    CacheFixture f;
    FS_Cache cache(L"dirs", L"files", f.cachePath().c_str(), false, true, &f.glue, L"prov");
    ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter writer;
    FsQuery query;
    everyFileBelow(query, tree.root);
    ASSERT_EQ(0, cache.executeQueryEx(writer, query, 600000, 3600));
    ASSERT_NE(0, cache.lastQueryStatistics().filesScanned);
    cache.cacheUnusable = true;
    EXPECT_EQ(CACHE_UNUSABLE, cache.executeQueryEx(writer, query, 600000, 3600));
    EXPECT_EQ("roots 0/0/0 files 0 dirs 0 hits 0 | unreadable 0 | undecodable 0 | too long 0 | no status 0",
              describe(cache.lastQueryStatistics()));
    cache.cacheUnusable = false;
    cache.close();
}

TEST(QueryStatisticsOfAQuery, RecordGoesWithItsObject)
{
    TempDir tree;
    tree.write("f.txt", "f");
    CacheFixture f;
    alignas(FS_Cache) unsigned char storage[sizeof(FS_Cache)];
    FS_Cache* first = new (storage) FS_Cache(L"dirs", L"files", f.cachePath().c_str(), false, true,
                                             &f.glue, L"prov");
    ASSERT_EQ(0, first->create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter writer;
    FsQuery query;
    everyFileBelow(query, trimmed(tree.path()));
    ASSERT_EQ(0, first->executeQueryEx(writer, query, 600000, 3600));
    ASSERT_EQ(1, first->lastQueryStatistics().filesScanned);
    first->close();
    first->~FS_Cache();
    // A new object at the same address starts with a record of its own.
    FS_Cache2* second = new (storage) FS_Cache2(L"dirs", L"files", f.cachePath().c_str(), false, true,
                                                &f.glue, L"prov");
    EXPECT_EQ("roots 0/0/0 files 0 dirs 0 hits 0 | unreadable 0 | undecodable 0 | too long 0 | no status 0",
              describe(second->lastQueryStatistics()));
    second->~FS_Cache2();
}

TEST(QueryStatisticsRecord, CopiesKeepEveryCountAndResetEmptiesIt)
{
    FsQueryStatistics record;
    record.rootsRebuilt = 2;
    record.addFile();
    record.addDirectory();
    record.addHit();
    record.addSkipped(FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY, "/top/", "locked", EACCES);
    record.addSkipped(FsQueryStatistics::SKIP_PATH_TOO_LONG, L"/top/long", 0);
    FsQueryStatistics copy(record);
    EXPECT_EQ(describe(record), describe(copy));
    EXPECT_EQ(2, copy.entriesScanned());
    EXPECT_EQ("/top/locked", copy.skipped[FsQueryStatistics::SKIP_UNREADABLE_DIRECTORY].paths.at(0));
    record.reset();
    EXPECT_EQ("roots 0/0/0 files 0 dirs 0 hits 0 | unreadable 0 | undecodable 0 | too long 0 | no status 0",
              describe(record));
    EXPECT_EQ(0, record.entriesScanned());
    FsQueryStatistics assigned;
    assigned = copy;
    EXPECT_EQ(describe(copy), describe(assigned));
    EXPECT_EQ(2, assigned.entriesScanned());
}
