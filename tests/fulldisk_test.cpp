// A cache on a file system that fills up.
//
// The table files are written through shared mappings, and a store into a
// page that the disk cannot back kills the process with SIGBUS.  So the file
// layer reserves the space before a byte is copied and a full disk refuses
// the write, the table refuses an insert whole (nothing of it is written),
// and the engine answers CACHE_ERROR (-53): the rows of the build that ran
// out of space are taken back, every other tree of the cache stays and is
// served, and the next query with room rebuilds what is missing.
//
// Most tests fill the "disk" through a fault-injecting Env, which grants the
// files whose name holds a pattern (a directory, or one file's name) a
// budget of space and refuses the rest with ENOSPC; they need no privilege.  The last ones mount a small tmpfs and fill
// it for real, through the library in a forked child (so that a SIGBUS fails
// the test instead of ending the suite) and through the fsquery tool.  They
// need root to mount and skip without it.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/statfs.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <utility>
#include <vector>
#include <cwctype>

#include <gtest/gtest.h>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/sysfile.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"
#include "support/error_env.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::widen;

namespace {

const unsigned int TEN_YEARS = 10u * 365u * 86400u;
const unsigned int GENEROUS_TIMEOUT = 600000;
const std::string kTool = std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery";
const uint32_t kChunk = LinuxMmFile::CHUNK;

// ------------------------------------------------------------ the filling disk

// A file system with a budget of free space, played by a fault-injecting Env
// for the files whose name contains a pattern: the library's reservations
// (posix_fallocate) of those files draw on the budget.  Like ext4 and tmpfs
// it charges a file only for bytes it has not reserved before; in "charges
// in full" mode it charges every request whole, as XFS does.  What it grants
// it reserves for real.
struct FillingDisk {
    static FillingDisk* current;
    testsupport::ErrorEnv env;
    testsupport::ScopedEnv installed;

    explicit FillingDisk(const std::string& filesContaining) : env(), installed(&env) {
        env.limitSpaceFor(filesContaining);
        current = this;
    }
    ~FillingDisk() { current = nullptr; }
    // From now on only bytes more fit.
    void fillAfter(long long bytes) { env.fillAfter(bytes); }
    void makeRoom() { env.makeRoom(); }
    void chargeInFull() { env.chargeInFull(true); }
    long long budget() const { return env.spaceLeft(); }
    int refusals() const { return env.refusals(); }
};

FillingDisk* FillingDisk::current = nullptr;

off_t sizeOnDisk(const std::string& path) {
    struct stat st;
    return stat(path.c_str(), &st) == 0 ? st.st_size : -1;
}

bool endsWith(const std::wstring& text, const std::wstring& tail) {
    return text.size() >= tail.size() && text.compare(text.size() - tail.size(), tail.size(), tail) == 0;
}

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

// ------------------------------------------------------------- the file layer

TEST(FullDiskFile, RefusedWriteLeavesTheFileAsItWasAndStillMapped) {
    TempDir dir;
    FillingDisk disk(dir.path());
    std::string path = dir.file("f.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::string head(100, 'h');
    ASSERT_EQ(100u, f.write(&head[0], 100));

    disk.fillAfter(0);
    // The page under the content is backed already: this needs no new space.
    std::string more(50, 'm');
    EXPECT_EQ(50u, f.write(&more[0], 50));
    std::string big(8000, 'b');
    errno = 0;
    EXPECT_EQ(0u, f.write(&big[0], 8000));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_EQ(1, disk.refusals());
    EXPECT_EQ(150u, f.logicalSize());
    EXPECT_EQ(kChunk, f.allocatedSize());
    EXPECT_EQ(150, f.tell());
    ASSERT_TRUE(f.seek(0, SEEK_FROM_START));
    char back[150];
    ASSERT_EQ(150u, f.read(back, 150));
    EXPECT_EQ(head + more, std::string(back, 150));

    disk.makeRoom();
    ASSERT_TRUE(f.seek(0, SEEK_FROM_END));
    EXPECT_EQ(8000u, f.write(&big[0], 8000));
    EXPECT_EQ(8150u, f.logicalSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(head + more + big, testsupport::readFile(path));
}

TEST(FullDiskFile, NewFileIsNotExtendedWhenItsFirstPageIsRefused) {
    TempDir dir;
    FillingDisk disk(dir.path());
    std::string path = dir.file("new.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    disk.fillAfter(0);
    char one = '1';
    errno = 0;
    EXPECT_EQ(0u, f.write(&one, 1));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_EQ(0u, f.logicalSize());
    EXPECT_EQ(0u, f.allocatedSize());
    EXPECT_EQ(0, sizeOnDisk(path));

    disk.makeRoom();
    EXPECT_EQ(1u, f.write(&one, 1));
    EXPECT_EQ(1u, f.logicalSize());
    EXPECT_EQ(kChunk, f.allocatedSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ("1", testsupport::readFile(path));
}

TEST(FullDiskFile, RefusedChunkGrowthKeepsTheOldMapping) {
    TempDir dir;
    FillingDisk disk(dir.path());
    std::string path = dir.file("chunk.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::string almost(kChunk - 10, 'a');
    ASSERT_EQ(almost.size(), f.write(&almost[0], static_cast<unsigned int>(almost.size())));
    ASSERT_EQ(kChunk, f.allocatedSize());

    disk.fillAfter(0);
    std::string tail(100, 't');
    errno = 0;
    EXPECT_EQ(0u, f.write(&tail[0], 100));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_EQ(kChunk, f.allocatedSize());
    EXPECT_EQ(kChunk - 10, f.logicalSize());
    EXPECT_EQ(static_cast<off_t>(kChunk), sizeOnDisk(path));
    // Still mapped: the content reads back.
    ASSERT_TRUE(f.seek(-10, SEEK_FROM_END));
    char last[10];
    ASSERT_EQ(10u, f.read(last, 10));
    EXPECT_EQ(std::string(10, 'a'), std::string(last, 10));

    disk.makeRoom();
    ASSERT_TRUE(f.seek(0, SEEK_FROM_END));
    EXPECT_EQ(100u, f.write(&tail[0], 100));
    EXPECT_EQ(2 * kChunk, f.allocatedSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(static_cast<off_t>(kChunk + 90), sizeOnDisk(path));
}

TEST(FullDiskFile, ReserveMakesRoomThatTheWritesThenUse) {
    TempDir dir;
    FillingDisk disk(dir.path());
    std::string path = dir.file("r.bin");
    LinuxMmFile f(path.c_str());
    EXPECT_FALSE(f.reserve(10));  // not open
    ASSERT_TRUE(f.create());
    std::string ten(10, 'x');
    ASSERT_EQ(10u, f.write(&ten[0], 10));
    ASSERT_TRUE(f.reserve(10000));
    // The content, the position and the end flag are left alone.
    EXPECT_EQ(10u, f.logicalSize());
    EXPECT_EQ(10, f.tell());
    EXPECT_FALSE(f.eof());

    disk.fillAfter(0);
    std::string piece(5000, 'p');
    EXPECT_EQ(5000u, f.write(&piece[0], 5000));
    EXPECT_EQ(5000u, f.write(&piece[0], 5000));
    EXPECT_EQ(0, disk.refusals());
    errno = 0;
    EXPECT_FALSE(f.reserve(5000));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_EQ(0u, f.write(&piece[0], 5000));
    EXPECT_EQ(10010u, f.logicalSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(static_cast<off_t>(10010), sizeOnDisk(path));
}

TEST(FullDiskFile, OpenBacksTheHolesOfAPaddedFileOrFails) {
    TempDir dir;
    std::string path = dir.file("padded.bin");
    // What a crash leaves: content, then zeros up to the allocation, unbacked.
    int fd = open(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(5, write(fd, "hello", 5));
    ASSERT_EQ(0, ftruncate(fd, 1 << 20));
    close(fd);
    struct stat st;
    ASSERT_EQ(0, stat(path.c_str(), &st));
    if (static_cast<long long>(st.st_blocks) * 512 >= (1 << 20)) {
        GTEST_SKIP() << "the temporary directory's file system keeps no holes";
    }

    FillingDisk disk(dir.path());
    disk.fillAfter(0);
    LinuxMmFile f(path.c_str());
    errno = 0;
    EXPECT_FALSE(f.open());
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_FALSE(f.isOpen());
    EXPECT_EQ(static_cast<off_t>(1 << 20), sizeOnDisk(path));  // not cut by a close

    disk.makeRoom();
    ASSERT_TRUE(f.open());
    ASSERT_EQ(0, stat(path.c_str(), &st));
    EXPECT_GE(static_cast<long long>(st.st_blocks) * 512, 1 << 20);
    char back[5];
    ASSERT_EQ(5u, f.read(back, 5));
    EXPECT_EQ("hello", std::string(back, 5));
    EXPECT_TRUE(f.close());
}

TEST(FullDiskFile, SpaceAlreadyReservedIsNotRefusedWhereTheDiskChargesAgain) {
    TempDir dir;
    struct statfs fs;
    ASSERT_EQ(0, statfs(dir.path().c_str(), &fs));
    const long kExt4 = 0xEF53, kXfs = 0x58465342, kBtrfs = 0x9123683E;
    if (fs.f_type != kExt4 && fs.f_type != kXfs && fs.f_type != kBtrfs) {
        GTEST_SKIP() << "needs a file system with an extent map (ext4, XFS, btrfs) for the temporary directory";
    }
    FillingDisk disk(dir.path());
    disk.chargeInFull();
    std::string path = dir.file("again.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::string header(100, 'h');
    ASSERT_EQ(100u, f.write(&header[0], 100));
    // Room for the next record is granted, and then the disk is full; the
    // write asks for the same pages again and must not be refused.
    disk.fillAfter(4096);
    ASSERT_TRUE(f.reserve(6000));
    EXPECT_EQ(0, disk.budget());
    std::string record(6000, 'r');
    EXPECT_EQ(6000u, f.write(&record[0], 6000));
    EXPECT_GE(disk.refusals(), 1);
    // Pages that were never reserved are still refused.
    EXPECT_EQ(0u, f.write(&record[0], 6000));
    EXPECT_TRUE(f.close());
    EXPECT_EQ(header + record, testsupport::readFile(path));
}

TEST(FullDiskFile, StdFileCloseReportsALostFlush) {
    // /dev/full takes every write into the stream's buffer and refuses it
    // when the buffer goes to the device.
    StdFile f(L"/dev/full");
    ASSERT_TRUE(f.create());
    char data[] = "lost";
    EXPECT_EQ(4u, f.write(data, 4));
    EXPECT_FALSE(f.close());
    EXPECT_FALSE(f.close());  // the stream is gone either way
}

// --------------------------------------------------------------- the tables

void setRow(Fields& f, const std::wstring& name, unsigned int size) {
    static_cast<TextField*>(f.at(0))->value(name.c_str());
    static_cast<Int32Field*>(f.at(1))->value(size);
}

std::wstring rowName(unsigned int n) { return L"row-" + std::to_wstring(n) + std::wstring(40, L'n'); }

// Every live row's name, in record order.
std::vector<std::wstring> names(FS_Table& t) {
    std::vector<std::wstring> out;
    Fields f(t.getFields());
    unsigned int id = 0;
    for (bool more = t.moveFirst(id); more; more = t.moveNext(id)) {
        EXPECT_TRUE(t.read(id, f));
        out.push_back(static_cast<TextField*>(f.at(0))->value());
    }
    return out;
}

unsigned int stored(FS_Table& t) {
    unsigned int n = 0;
    EXPECT_TRUE(t.count(0, &n));
    return n;
}

class FullDiskTable : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = widen(dir.path() + "/");
    }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore); }

    // Columns name:Text size:Int32, an index on each; armed guard.
    std::unique_ptr<FS_Table> namesTable(bool compressed, bool create = true) {
        std::unique_ptr<FS_Table> t(new FS_Table(L"names", wdir.c_str(), compressed));
        if (create) {
            t->addField(L"name", FIELD_TEXT);
            t->addField(L"size", FIELD_INT32);
            EXPECT_TRUE(t->create());
            EXPECT_TRUE(t->addHashIndex(L"names_name", L"name"));
            EXPECT_TRUE(t->addHashIndex(L"names_size", L"size"));
        } else {
            EXPECT_TRUE(t->open());
        }
        EXPECT_TRUE(t->verify());
        return t;
    }
    TempDir dir;
    TempDir locks;
    std::wstring wdir;
    char savedStore[sizeof LinuxSharedMutex::storePath];
};

// Inserts rows until the disk refuses one (at most limit); the count of the
// rows that went in.  Every row has the same size, so that each insert
// appends an overflow slot to the size index.
unsigned int insertUntilRefused(FS_Table& t, unsigned int first, unsigned int limit, bool* refused) {
    Fields f(t.getFields());
    *refused = false;
    for (unsigned int n = first; n < first + limit; ++n) {
        setRow(f, rowName(n), 7);
        if (!t.insert(f)) {
            *refused = true;
            return n - first;
        }
    }
    return limit;
}

void refusedInsertLeavesTheTableSound(const char* fileSuffix, std::unique_ptr<FS_Table> t,
                                      const std::wstring& wideSuffix) {
    FillingDisk disk(fileSuffix);
    bool refused = false;
    ASSERT_EQ(5u, insertUntilRefused(*t, 0, 5, &refused));
    disk.fillAfter(0);
    unsigned int more = insertUntilRefused(*t, 5, 5000, &refused);
    ASSERT_TRUE(refused) << "the disk never ran out for " << fileSuffix;
    unsigned int inside = 5 + more;
    EXPECT_EQ(inside, stored(*t));
    EXPECT_TRUE(t->writeFailed());
    EXPECT_EQ(ENOSPC, t->writeError());
    ASSERT_NE(nullptr, t->failedWriteFile());
    EXPECT_TRUE(endsWith(t->failedWriteFile(), wideSuffix)) << fileSuffix;

    // The failure holds until it is cleared, even with room again.
    disk.makeRoom();
    Fields f(t->getFields());
    setRow(f, L"after", 1);
    EXPECT_FALSE(t->insert(f));
    EXPECT_EQ(inside, stored(*t));
    t->clearWriteFailure();
    EXPECT_FALSE(t->writeFailed());
    ASSERT_TRUE(t->insert(f));

    // Every file agrees with the others, and every row that went in is there.
    ASSERT_TRUE(t->close());
    std::unique_ptr<FS_Table> again(new FS_Table(L"names", t->getDirectory(), t->isCompressed()));
    ASSERT_TRUE(again->open());
    EXPECT_TRUE(again->verify()) << again->damagedCheck();
    std::vector<std::wstring> rows = names(*again);
    ASSERT_EQ(inside + 1, rows.size());
    for (unsigned int n = 0; n < inside; ++n) EXPECT_EQ(rowName(n), rows[n]);
    EXPECT_EQ(L"after", rows.back());
    Index* byName = again->searchHashIndexForIndexName(L"names_name", false);
    ASSERT_NE(nullptr, byName);
    std::wstring key = rowName(inside - 1);
    for (wchar_t& c : key) c = static_cast<wchar_t>(towupper(c));
    unsigned int id = 0, next = 0;
    EXPECT_TRUE(again->hashIndex_moveFirst(*byName, key.c_str(), id, next));
    EXPECT_EQ(inside - 1, id);
    again->close();
}

TEST_F(FullDiskTable, InsertRefusedForThePointerFileLeavesTheTableAsItWas) {
    refusedInsertLeavesTheTableSound(".pxx", namesTable(false), L".pxx");
}

TEST_F(FullDiskTable, InsertRefusedForTheDataFileLeavesTheTableAsItWas) {
    refusedInsertLeavesTheTableSound("names.dat", namesTable(true), L"names.dat");
}

TEST_F(FullDiskTable, InsertRefusedForAnIndexFileLeavesTheTableAsItWas) {
    refusedInsertLeavesTheTableSound("names_size.idx", namesTable(false), L"names_size.idx");
}

TEST_F(FullDiskTable, RefusedUpdateOfACompressedTableKeepsTheOldRecord) {
    std::unique_ptr<FS_Table> t = namesTable(true);
    Fields f(t->getFields());
    setRow(f, L"first", 1);
    ASSERT_TRUE(t->insert(f));
    setRow(f, L"second", 2);
    ASSERT_TRUE(t->insert(f));

    FillingDisk disk(dir.path());
    disk.fillAfter(0);
    setRow(f, std::wstring(5000, L'l'), 3);
    EXPECT_FALSE(t->update(0, f));
    EXPECT_TRUE(t->writeFailed());
    EXPECT_EQ(2u, stored(*t));
    EXPECT_EQ((std::vector<std::wstring>{L"first", L"second"}), names(*t));
    EXPECT_TRUE(t->verify());

    disk.makeRoom();
    t->clearWriteFailure();
    EXPECT_TRUE(t->update(0, f));
    EXPECT_EQ((std::vector<std::wstring>{L"second", std::wstring(5000, L'l')}), names(*t));
}

TEST_F(FullDiskTable, CompactionThatRunsOutOfSpaceLeavesTheTableAsItWas) {
    std::unique_ptr<FS_Table> t = namesTable(false);
    bool refused = false;
    ASSERT_EQ(400u, insertUntilRefused(*t, 0, 400, &refused));
    for (unsigned int id = 0; id < 400; id += 2) ASSERT_TRUE(t->remove(id));
    ASSERT_TRUE(t->close());

    // The copy's files get room for their headers and indexes and little
    // more: the copy runs out half way.
    FillingDisk disk("_cpt");
    disk.fillAfter(2 * 524288 + 6 * 4096);
    EXPECT_FALSE(t->compact(30));
    EXPECT_GE(disk.refusals(), 1);
    for (const char* left : {"names_cpt.dat", "names_cpt.pxx", "names_name_cpt.idx", "names_size_cpt.idx"})
        EXPECT_FALSE(testsupport::fileExists(dir.file(left))) << left;

    std::unique_ptr<FS_Table> again = namesTable(false, false);
    EXPECT_EQ(200u, stored(*again));
    std::vector<std::wstring> rows = names(*again);
    ASSERT_EQ(200u, rows.size());
    EXPECT_EQ(rowName(1), rows.front());
    EXPECT_EQ(rowName(399), rows.back());
    again->close();

    disk.makeRoom();
    EXPECT_TRUE(again->compact(30));
    std::unique_ptr<FS_Table> compacted = namesTable(false, false);
    EXPECT_EQ(200u, stored(*compacted));
    EXPECT_EQ(rows, names(*compacted));
}

// --------------------------------------------------------------- the engine

class FullDiskCache : public ::testing::Test {
protected:
    // A tree of count files with long names in a few directories.
    std::string makeTree(const std::string& name, int count) {
        std::string root = work.mkdirs(name);
        for (int i = 0; i < count; ++i)
            work.write(name + "/d" + std::to_string(i % 7) + "/" + std::string(120, 'f') + std::to_string(i) + ".txt",
                       "x");
        return root;
    }
    static void treeQuery(FsQuery& q, const std::string& root, const std::string& exclude = "") {
        q.setQuery(L"[SIZE]>=0");
        q.setCaseSensitive(0);
        q.addIncludePath(widen(root).c_str(), true);
        if (!exclude.empty()) q.addExcludePath(widen(exclude).c_str(), true);
    }
    // One query on a fresh object, as a host runs it; errno of the query's
    // result in *reason.
    int runQuery(FsQuery& q, testsupport::HitWriter& w, bool compressed, int* reason = nullptr,
                 int* scanned = nullptr) {
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), compressed, true, &glue, L"prov");
        EXPECT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        EXPECT_EQ(0, c.lock());
        errno = 0;
        int rc = c.executeQueryEx(w, q, GENEROUS_TIMEOUT, TEN_YEARS);
        if (reason != nullptr) *reason = errno;
        if (scanned != nullptr) *scanned = c.filesScanned;
        c.unlock();
        c.close();
        return rc;
    }

    testsupport::MachineFixture machine;
    TempDir work;
    TempDir cacheDir;
};

TEST_F(FullDiskCache, BuildRefusedByAFullDiskIsACacheErrorAndTheNextQueryRebuilds) {
    std::string tree = makeTree("tree", 300);
    // The files table's records run out of space after a few dozen rows,
    // in the middle of the tree.
    FillingDisk disk("files.dat");
    {
        // Made with room: the empty tables and their indexes.
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"dirs", L"files", widen(cacheDir.path()).c_str(), true, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        c.close();
    }
    disk.fillAfter(2 * 4096);
    testsupport::TraceCapture cap(QvLogWrapper::LEVEL_MIN);
    FsQuery q;
    treeQuery(q, tree);
    testsupport::HitWriter w;
    int reason = 0;
    EXPECT_EQ(CACHE_ERROR, runQuery(q, w, true, &reason));
    EXPECT_EQ(ENOSPC, reason);
    EXPECT_GE(disk.refusals(), 1);
    EXPECT_TRUE(w.hits.empty()) << "nothing of a failed query is served";
    EXPECT_TRUE(cap.contains("(WRITE FAILED) cannot write the cache file '")) << cap.dump();
    EXPECT_TRUE(cap.contains("files.dat' while building '" + tree + "'")) << cap.dump();
    EXPECT_TRUE(cap.contains("No space left on device")) << cap.dump();

    // With room again the next query opens the same cache (nothing in it is
    // damaged) and builds the tree whole.
    disk.makeRoom();
    testsupport::HitWriter again;
    EXPECT_EQ(0, runQuery(q, again, true));
    EXPECT_FALSE(cap.contains("damaged cache file")) << cap.dump();
    std::set<std::string> expected = testsupport::findFiles(tree);
    EXPECT_EQ(300u, expected.size());
    EXPECT_TRUE(expected == again.hits);
    testsupport::HitWriter third;
    int scanned = -1;
    EXPECT_EQ(0, runQuery(q, third, true, nullptr, &scanned));
    EXPECT_EQ(0, scanned) << "served from the cache";
    EXPECT_TRUE(expected == third.hits);
}

TEST_F(FullDiskCache, EarlierTreeSurvivesAFailedRebuildOfAnotherTree) {
    std::string treeA = makeTree("a", 150);
    std::string treeB = makeTree("b", 400);
    FillingDisk disk("files.dat");
    FsQuery qa;
    treeQuery(qa, treeA);
    FsQuery qb;
    treeQuery(qb, treeB);
    testsupport::HitWriter wa, wb;
    ASSERT_EQ(0, runQuery(qa, wa, false));
    ASSERT_EQ(0, runQuery(qb, wb, false));
    std::set<std::string> filesA = testsupport::findFiles(treeA);
    std::set<std::string> filesB = testsupport::findFiles(treeB);
    ASSERT_TRUE(filesA == wa.hits);
    ASSERT_TRUE(filesB == wb.hits);

    // Other excludes make B's tree invalid: the engine removes it and builds
    // it again, and the disk runs out during that build, a page of records
    // later.
    disk.fillAfter(4096);
    {
        testsupport::TraceCapture cap;
        FsQuery qb2;
        treeQuery(qb2, treeB, treeB + "/d3");
        testsupport::HitWriter w;
        int reason = 0;
        EXPECT_EQ(CACHE_ERROR, runQuery(qb2, w, false, &reason));
        EXPECT_EQ(ENOSPC, reason);
        EXPECT_TRUE(cap.contains("Existing tree for '" + treeB + "' in the cache is not valid")) << cap.dump();
        EXPECT_TRUE(cap.contains("(WRITE FAILED)")) << cap.dump();
        EXPECT_TRUE(w.hits.empty());
    }

    // A is still in the cache and served from it, the disk still full.
    {
        testsupport::TraceCapture cap;
        testsupport::HitWriter w;
        int scanned = -1;
        EXPECT_EQ(0, runQuery(qa, w, false, nullptr, &scanned));
        EXPECT_EQ(0, scanned);
        EXPECT_TRUE(cap.contains("retrieving data from cache for '" + treeA + "'")) << cap.dump();
        EXPECT_FALSE(cap.contains("damaged cache file")) << cap.dump();
        EXPECT_TRUE(filesA == w.hits);
    }

    // With room B is built again.  Asked as it was first built, B would pass
    // every validity test if rows of the failed build were left: none are,
    // so it is built whole.
    disk.makeRoom();
    {
        testsupport::TraceCapture cap;
        testsupport::HitWriter w;
        EXPECT_EQ(0, runQuery(qb, w, false));
        EXPECT_FALSE(cap.contains("retrieving data from cache for '" + treeB + "'")) << cap.dump();
        EXPECT_TRUE(filesB == w.hits);
    }
    FsQuery qb3;
    treeQuery(qb3, treeB, treeB + "/d3");
    testsupport::HitWriter w;
    EXPECT_EQ(0, runQuery(qb3, w, false));
    std::set<std::string> expected;
    for (const std::string& p : filesB)
        if (p.compare(0, treeB.size() + 4, treeB + "/d3/") != 0) expected.insert(p);
    EXPECT_LT(expected.size(), filesB.size());
    EXPECT_TRUE(expected == w.hits);
    testsupport::HitWriter w2;
    EXPECT_EQ(0, runQuery(qa, w2, false));
    EXPECT_TRUE(filesA == w2.hits);
}

// The disk fills as the scan reaches a directory below this one.
std::string gFillBelow;

void fillWhenScanReaches(char const* directory) {
    if (!gFillBelow.empty() && std::strncmp(directory, gFillBelow.c_str(), gFillBelow.size()) == 0)
        FillingDisk::current->fillAfter(0);
}

TEST_F(FullDiskCache, RootBuiltBeforeTheRefusedOneInTheSameQueryIsKept) {
    std::string treeA = makeTree("a", 150);
    std::string treeB = makeTree("b", 400);
    FillingDisk disk("files.dat");
    gFillBelow = treeB;
    FS_CacheBase::scanHook = &fillWhenScanReaches;
    FsQuery both;
    treeQuery(both, treeA);
    both.addIncludePath(widen(treeB).c_str(), true);
    testsupport::HitWriter w;
    int reason = 0;
    int rc = runQuery(both, w, true, &reason);
    FS_CacheBase::scanHook = nullptr;
    gFillBelow.clear();
    ASSERT_EQ(CACHE_ERROR, rc);
    EXPECT_EQ(ENOSPC, reason);
    EXPECT_TRUE(w.hits.empty());

    // A's rows stay, with ids the saved counter covers: the cache opens
    // sound and serves A without a walk.
    disk.makeRoom();
    testsupport::TraceCapture cap;
    FsQuery qa;
    treeQuery(qa, treeA);
    testsupport::HitWriter wa;
    int scanned = -1;
    EXPECT_EQ(0, runQuery(qa, wa, true, nullptr, &scanned));
    EXPECT_FALSE(cap.contains("damaged cache file")) << cap.dump();
    EXPECT_EQ(0, scanned);
    EXPECT_TRUE(testsupport::findFiles(treeA) == wa.hits);
    testsupport::HitWriter wb;
    FsQuery qb;
    treeQuery(qb, treeB);
    EXPECT_EQ(0, runQuery(qb, wb, true));
    EXPECT_TRUE(testsupport::findFiles(treeB) == wb.hits);
}

// -------------------------------------------------- a real, small file system

// A tmpfs of a few MiB mounted on a temporary directory for the test's
// length; unmounted in TearDown whatever happened.  Skips without root or
// where mounting is not allowed (a container without CAP_SYS_ADMIN).
class FullTmpfs : public ::testing::Test {
protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "needs root to mount a small tmpfs";
        }
        mountPoint = work.mkdirs("mnt");
        if (mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "size=3m") != 0) {
            GTEST_SKIP() << "cannot mount a tmpfs here: " << std::strerror(errno);
        }
        mounted = true;
        // About 3,000 rows of long names: far more than the 3 MiB hold once
        // the empty tables and their five 512 KiB indexes are made.
        tree = work.mkdirs("tree");
        for (int i = 0; i < 3000; ++i) {
            std::string dir = tree + "/dir" + std::to_string(i % 30);
            if (i < 30) {
                ASSERT_EQ(0, mkdir(dir.c_str(), 0700));
            }
            std::string file = dir + "/" + std::string(200, 'n') + std::to_string(i);
            int fd = open(file.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            ASSERT_GE(fd, 0);
            close(fd);
        }
    }
    void TearDown() override {
        if (mounted && umount(mountPoint.c_str()) != 0) umount2(mountPoint.c_str(), MNT_DETACH);
    }

    TempDir work;
    std::string mountPoint;
    std::string tree;
    bool mounted = false;
};

// Runs work in a child process and gives what it wrote, or why it ended
// otherwise (a signal is reported, not passed on to the suite).
struct ChildOutcome {
    bool exited = false;
    int signal = 0;
    std::string report;
};

ChildOutcome inChild(const std::function<std::string()>& work) {
    ChildOutcome outcome;
    int fds[2];
    if (pipe(fds) != 0) return outcome;
    pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        std::string report = work();
        size_t done = 0;
        while (done < report.size()) {
            ssize_t n = write(fds[1], report.data() + done, report.size() - done);
            if (n <= 0) _exit(3);
            done += static_cast<size_t>(n);
        }
        _exit(0);
    }
    close(fds[1]);
    char buffer[4096];
    for (;;) {
        ssize_t n = read(fds[0], buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        outcome.report.append(buffer, static_cast<size_t>(n));
    }
    close(fds[0]);
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    outcome.exited = WIFEXITED(status) && WEXITSTATUS(status) == 0;
    if (WIFSIGNALED(status)) outcome.signal = WTERMSIG(status);
    return outcome;
}

// "key=value" lines of a child's report.
std::map<std::string, std::string> fields(const std::string& report) {
    std::map<std::string, std::string> out;
    std::istringstream in(report);
    std::string line;
    while (std::getline(in, line)) {
        size_t eq = line.find('=');
        if (eq != std::string::npos) out[line.substr(0, eq)] = line.substr(eq + 1);
    }
    return out;
}

TEST_F(FullTmpfs, LibraryBuildOnAFullFileSystemIsACacheErrorNotASignal) {
    testsupport::MachineFixture machine;
    std::string cache = mountPoint + "/c";
    ASSERT_EQ(0, mkdir(cache.c_str(), 0700));
    std::string root = tree;
    auto query = [cache, root]() {
        testsupport::TraceCapture cap(QvLogWrapper::LEVEL_MIN);
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"dirs", L"files", widen(cache).c_str(), true, true, &glue, L"prov");
        std::ostringstream out;
        errno = 0;
        int created = c.create(0, FS_CACHE_OPEN_ALWAYS);
        out << "create=" << created << "\n";
        if (created != 0) out << "createErrno=" << errno << "\n";
        if (created == 0 && c.lock() == 0) {
            FsQuery q;
            q.setQuery(L"[SIZE]>=0");
            q.addIncludePath(widen(root).c_str(), true);
            testsupport::HitWriter w;
            errno = 0;
            int rc = c.executeQueryEx(w, q, GENEROUS_TIMEOUT, TEN_YEARS);
            out << "query=" << rc << "\nqueryErrno=" << errno << "\nhits=" << w.hits.size() << "\n";
            c.unlock();
        }
        c.close();
        out << "traced=" << (cap.contains("No space left on device") ? 1 : 0) << "\n";
        return out.str() + "trace:\n" + cap.dump();
    };

    ChildOutcome full = inChild(query);
    ASSERT_EQ(0, full.signal) << "the child died of signal " << full.signal;
    ASSERT_TRUE(full.exited) << full.report;
    std::map<std::string, std::string> r = fields(full.report);
    if (r["create"] == "0") {
        EXPECT_EQ(std::to_string(CACHE_ERROR), r["query"]) << full.report;
        EXPECT_EQ(std::to_string(ENOSPC), r["queryErrno"]) << full.report;
        EXPECT_EQ("0", r["hits"]) << full.report;
    } else {
        // A file system too small even for the empty tables.
        EXPECT_EQ(std::to_string(CACHE_ERROR), r["create"]) << full.report;
        EXPECT_EQ(std::to_string(ENOSPC), r["createErrno"]) << full.report;
    }
    EXPECT_EQ("1", r["traced"]) << full.report;

    // Grown, the same file system takes the tree, in the cache left behind.
    ASSERT_EQ(0, mount("tmpfs", mountPoint.c_str(), "tmpfs", MS_REMOUNT, "size=64m")) << std::strerror(errno);
    ChildOutcome roomy = inChild(query);
    ASSERT_EQ(0, roomy.signal);
    ASSERT_TRUE(roomy.exited) << roomy.report;
    std::map<std::string, std::string> r2 = fields(roomy.report);
    EXPECT_EQ("0", r2["create"]) << roomy.report;
    EXPECT_EQ("0", r2["query"]) << roomy.report;
    EXPECT_EQ("3000", r2["hits"]) << roomy.report;
}

TEST_F(FullTmpfs, ToolOnAFullFileSystemExitsWithCacheErrorAndSaysWhy) {
    std::string mtab = work.write("mtab", "/dev/vda / ext4 rw 0 0\n");
    std::string outName = work.file("tool.out"), errName = work.file("tool.err");
    pid_t pid = fork();
    if (pid == 0) {
        int out = open(outName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int err = open(errName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        int in = open("/dev/null", O_RDONLY);
        dup2(in, 0);
        dup2(out, 1);
        dup2(err, 2);
        setenv("HOME", work.file("home").c_str(), 1);
        setenv("XDG_CACHE_HOME", work.file("xdg").c_str(), 1);
        unsetenv("FSCANNER_TRACE_LEVEL");
        unsetenv("FSCANNER_TRACE_FILE");
        unsetenv("FSCANNER_CONFIG");
        testsupport::execBuildProgram({kTool, "--mount-table", mtab, "--cache", mountPoint + "/tool", "--name",
                                       "nothing-is-called-this", tree});
        _exit(98);
    }
    ASSERT_GT(pid, 0);
    int status = 0;
    ASSERT_EQ(pid, waitpid(pid, &status, 0));
    std::string err = testsupport::readFile(errName);
    ASSERT_FALSE(WIFSIGNALED(status)) << "fsquery died of signal " << WTERMSIG(status) << "\n" << err;
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(8, WEXITSTATUS(status)) << err;  // cache error
    EXPECT_TRUE(contains(err, "cache error (-53)")) << err;
    EXPECT_TRUE(contains(err, "No space left on device")) << err;
    EXPECT_EQ(1, std::count(err.begin(), err.end(), '\n')) << err;
}

}  // namespace
