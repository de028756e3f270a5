// Natural merge sort on files, driven through callbacks over a fixed record of
// 8 bytes: a 32-bit key and a 32-bit sequence number (host order).  The
// sequence number tells equal keys apart, so the tests can see stability.
#include "fscanner/fscommon/naturalmerge.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/sysfile.h"
#include "support/testsupport.h"

namespace {

struct Rec {
    int32_t key;
    int32_t seq;
};

int g_reads = 0;
int g_writes = 0;
int g_peeks = 0;
int g_live = 0;  // records allocated and not yet freed

void resetCounters() {
    g_reads = g_writes = g_peeks = g_live = 0;
}

bool compareRec(void* a, void* b, unsigned int op, bool) {
    int32_t x = static_cast<Rec*>(a)->key;
    int32_t y = static_cast<Rec*>(b)->key;
    switch (op) {
        case 0: return x == y;
        case 1: return x >= y;
        case 2: return x <= y;
        case 3: return x > y;
        case 4: return x < y;
        case 5: return x != y;
    }
    return false;
}

int readRec(AbstractFile* file, void** record) {
    ++g_reads;
    Rec* r = new Rec();
    ++g_live;
    if (file->read(r, sizeof(Rec)) != sizeof(Rec)) {
        delete r;
        --g_live;
        *record = nullptr;
        return 0;
    }
    *record = r;
    return 1;
}

int writeRec(AbstractFile* file, void* record) {
    ++g_writes;
    if (record == nullptr) return 0;
    return file->write(record, sizeof(Rec)) == sizeof(Rec) ? 1 : 0;
}

bool peekRec(AbstractFile* file, void** record) {
    ++g_peeks;
    long position = file->tell();
    Rec* r = new Rec();
    ++g_live;
    if (file->read(r, sizeof(Rec)) == sizeof(Rec) && !file->eof()) {
        file->seek(position, SEEK_FROM_START);
        *record = r;
        return true;
    }
    delete r;
    --g_live;
    *record = nullptr;
    return false;
}

void freeRec(void* record) {
    if (record != nullptr) --g_live;
    delete static_cast<Rec*>(record);
}

NaturalMergeSort makeSorter() {
    return NaturalMergeSort(compareRec, readRec, writeRec, peekRec, freeRec);
}

std::string encode(const std::vector<Rec>& records) {
    std::string bytes;
    for (const Rec& r : records) bytes.append(reinterpret_cast<const char*>(&r), sizeof(Rec));
    return bytes;
}

std::vector<Rec> decode(const std::string& bytes) {
    std::vector<Rec> records(bytes.size() / sizeof(Rec));
    if (!records.empty()) std::memcpy(records.data(), bytes.data(), records.size() * sizeof(Rec));
    return records;
}

// Records with keys as given and sequence numbers 0, 1, 2, ...
std::vector<Rec> withKeys(const std::vector<int32_t>& keys) {
    std::vector<Rec> records;
    for (size_t i = 0; i < keys.size(); ++i) records.push_back(Rec{keys[i], static_cast<int32_t>(i)});
    return records;
}

std::vector<int32_t> seqs(const std::vector<Rec>& records) {
    std::vector<int32_t> out;
    for (const Rec& r : records) out.push_back(r.seq);
    return out;
}

std::vector<int32_t> keysOf(const std::vector<Rec>& records) {
    std::vector<int32_t> out;
    for (const Rec& r : records) out.push_back(r.key);
    return out;
}

std::wstring wide(const std::string& s) {
    return std::wstring(s.begin(), s.end());
}

bool sortFile(const std::string& path, unsigned int order) {
    NaturalMergeSort sorter = makeSorter();
    std::wstring name = wide(path);
    return sorter.sort(&name[0], order, true);
}

// A LinuxMmFile holding the given records, open, positioned at 0.
AbstractFile* openWith(const testsupport::TempDir& dir, const std::string& rel,
                       const std::vector<Rec>& records) {
    std::string path = dir.write(rel, encode(records));
    std::wstring name = wide(path);
    AbstractFile* file = SysFactory::createMmFile(name.c_str());
    EXPECT_TRUE(file->open());
    return file;
}

AbstractFile* createEmpty(const testsupport::TempDir& dir, const std::string& rel) {
    std::wstring name = wide(dir.file(rel));
    AbstractFile* file = SysFactory::createMmFile(name.c_str());
    EXPECT_TRUE(file->create());
    return file;
}

std::vector<Rec> contentOf(AbstractFile* file, const std::string& path) {
    file->close();
    return decode(testsupport::readFile(path));
}

class NaturalMergeSortTest : public ::testing::Test {
protected:
    void SetUp() override { resetCounters(); }
    void TearDown() override { EXPECT_EQ(0, g_live) << "records leaked"; }
    testsupport::TempDir dir;
};

TEST_F(NaturalMergeSortTest, SortedFileIsOneRunSortedInOnePassWithOrderUnchanged) {
    std::vector<Rec> input = withKeys({1, 2, 2, 3, 5, 8, 8, 13});
    std::string path = dir.write("sorted", encode(input));
    ASSERT_TRUE(sortFile(path, 1));
    // One pass writes every record twice: once to a scratch file, once back.
    EXPECT_EQ(16, g_writes);
    EXPECT_EQ(seqs(input), seqs(decode(testsupport::readFile(path))));
}

TEST_F(NaturalMergeSortTest, ReversedInputTakesLogarithmicPasses) {
    // 8 runs of one record: 8 -> 4 -> 2 -> 1 runs, three passes.
    std::string path = dir.write("reversed", encode(withKeys({8, 7, 6, 5, 4, 3, 2, 1})));
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_EQ(48, g_writes);
    EXPECT_EQ((std::vector<int32_t>{1, 2, 3, 4, 5, 6, 7, 8}),
              keysOf(decode(testsupport::readFile(path))));
}

TEST_F(NaturalMergeSortTest, EachPassIsTracedWithTheRunsItMerged) {
    testsupport::TraceCapture capture;
    std::string path = dir.write("reversed", encode(withKeys({4, 3, 2, 1})));
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_EQ(2u, capture.count("NaturalMergeSort::sort - pass ")) << capture.dump();
    EXPECT_TRUE(capture.contains("NaturalMergeSort::sort - pass 1 merged 2 runs"));
    EXPECT_TRUE(capture.contains("NaturalMergeSort::sort - pass 2 merged 1 runs"));
}

TEST_F(NaturalMergeSortTest, SingleRecordIsOneRun) {
    std::vector<Rec> input = withKeys({42});
    std::string path = dir.write("one", encode(input));
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_EQ(2, g_writes);
    EXPECT_EQ(encode(input), testsupport::readFile(path));
}

TEST_F(NaturalMergeSortTest, CopyOfLastRecordEndsRunWithNoFollower) {
    AbstractFile* source = openWith(dir, "src", withKeys({7}));
    AbstractFile* target = createEmpty(dir, "dst");
    NaturalMergeSort sorter = makeSorter();
    void* next = reinterpret_cast<void*>(1);
    EXPECT_TRUE(sorter.copy(source, target, &next));
    EXPECT_EQ(nullptr, next);
    EXPECT_TRUE(sorter.eof(source));
    EXPECT_EQ(encode(withKeys({7})), encode(contentOf(target, dir.file("dst"))));
    delete source;
    delete target;
}

TEST_F(NaturalMergeSortTest, CopyAtEndOfFileWritesNothing) {
    AbstractFile* source = openWith(dir, "src", withKeys({7}));
    AbstractFile* target = createEmpty(dir, "dst");
    NaturalMergeSort sorter = makeSorter();
    ASSERT_TRUE(source->seek(0, SEEK_FROM_END));
    void* next = nullptr;
    EXPECT_TRUE(sorter.copy(source, target, &next));
    EXPECT_EQ(nullptr, next);
    EXPECT_EQ(0, g_writes);
    EXPECT_TRUE(contentOf(target, dir.file("dst")).empty());
    delete source;
    delete target;
}

TEST_F(NaturalMergeSortTest, CopyGivesFollowerAndTellsWhetherRunEnds) {
    AbstractFile* source = openWith(dir, "src", withKeys({1, 2, 0}));
    AbstractFile* target = createEmpty(dir, "dst");
    NaturalMergeSort sorter = makeSorter();
    void* next = nullptr;
    EXPECT_FALSE(sorter.copy(source, target, &next));  // 1 then 2: run goes on
    ASSERT_NE(nullptr, next);
    EXPECT_EQ(2, static_cast<Rec*>(next)->key);
    freeRec(next);
    EXPECT_TRUE(sorter.copy(source, target, &next));  // 2 then 0: run ends
    ASSERT_NE(nullptr, next);
    EXPECT_EQ(0, static_cast<Rec*>(next)->key);
    freeRec(next);
    // The follower was only peeked: the source stands at it.
    EXPECT_EQ(static_cast<long>(2 * sizeof(Rec)), source->tell());
    delete source;
    delete target;
}

TEST_F(NaturalMergeSortTest, DistributeDealsRunsAlternately) {
    AbstractFile* source = openWith(dir, "src", withKeys({3, 4, 1, 2, 0, 9, 5}));
    AbstractFile* a = createEmpty(dir, "a");
    AbstractFile* b = createEmpty(dir, "b");
    NaturalMergeSort sorter = makeSorter();
    sorter.distribute(source, a, b);
    // Runs [3 4] [1 2] [0 9] [5]: a gets the first and third, b the others.
    EXPECT_EQ((std::vector<int32_t>{3, 4, 0, 9}), keysOf(contentOf(a, dir.file("a"))));
    EXPECT_EQ((std::vector<int32_t>{1, 2, 5}), keysOf(contentOf(b, dir.file("b"))));
    delete source;
    delete a;
    delete b;
}

TEST_F(NaturalMergeSortTest, MergeCountsRunsWrittenAndCopiesLeftovers) {
    AbstractFile* a = openWith(dir, "a", withKeys({1, 3, 2}));  // runs [1 3] [2]
    AbstractFile* b = openWith(dir, "b", withKeys({0}));          // run [0]
    AbstractFile* target = createEmpty(dir, "t");
    NaturalMergeSort sorter = makeSorter();
    EXPECT_EQ(2u, sorter.merge(a, b, target));
    EXPECT_EQ((std::vector<int32_t>{0, 1, 3, 2}), keysOf(contentOf(target, dir.file("t"))));
    delete a;
    delete b;
    delete target;
}

TEST_F(NaturalMergeSortTest, MergeOfTwoEmptyFilesWritesNoRun) {
    AbstractFile* a = createEmpty(dir, "a");
    AbstractFile* b = createEmpty(dir, "b");
    AbstractFile* target = createEmpty(dir, "t");
    NaturalMergeSort sorter = makeSorter();
    EXPECT_EQ(0u, sorter.merge(a, b, target));
    delete a;
    delete b;
    delete target;
}

TEST_F(NaturalMergeSortTest, EqualKeysKeepTheirOrderWithinARun) {
    std::string path = dir.write("f", encode(withKeys({4, 4, 4, 1, 1})));
    ASSERT_TRUE(sortFile(path, 1));
    std::vector<Rec> out = decode(testsupport::readFile(path));
    EXPECT_EQ((std::vector<int32_t>{1, 1, 4, 4, 4}), keysOf(out));
    EXPECT_EQ((std::vector<int32_t>{3, 4, 0, 1, 2}), seqs(out));
}

TEST_F(NaturalMergeSortTest, MergeRunTakesTheFirstScratchFileOnTiesAscending) {
    AbstractFile* a = openWith(dir, "a", std::vector<Rec>{{5, 100}, {6, 101}});
    AbstractFile* b = openWith(dir, "b", std::vector<Rec>{{5, 200}, {6, 201}});
    AbstractFile* target = createEmpty(dir, "t");
    NaturalMergeSort sorter = makeSorter();
    sorter.mergerun(a, b, target);
    EXPECT_EQ((std::vector<int32_t>{100, 200, 101, 201}), seqs(contentOf(target, dir.file("t"))));
    delete a;
    delete b;
    delete target;
}

TEST_F(NaturalMergeSortTest, MergeRunTakesTheFirstScratchFileOnTiesDescending) {
    // A sort with order 2 sets the descending operators before it fails on
    // the missing file.
    NaturalMergeSort sorter = makeSorter();
    std::wstring missing = wide(dir.file("missing"));
    ASSERT_FALSE(sorter.sort(&missing[0], 2, true));
    AbstractFile* a = openWith(dir, "a", std::vector<Rec>{{6, 100}, {5, 101}});
    AbstractFile* b = openWith(dir, "b", std::vector<Rec>{{6, 200}, {5, 201}});
    AbstractFile* target = createEmpty(dir, "t");
    sorter.mergerun(a, b, target);
    EXPECT_EQ((std::vector<int32_t>{100, 200, 101, 201}), seqs(contentOf(target, dir.file("t"))));
    delete a;
    delete b;
    delete target;
}

TEST_F(NaturalMergeSortTest, TieAcrossAMergeGoesToTheRecordFromTheFirstScratchFile) {
    // Runs [5] [3 5]: 5(seq 0) goes to .a, 3 and 5(seq 2) to .b.
    std::string path = dir.write("f", encode(withKeys({5, 3, 5})));
    ASSERT_TRUE(sortFile(path, 1));
    std::vector<Rec> out = decode(testsupport::readFile(path));
    EXPECT_EQ((std::vector<int32_t>{3, 5, 5}), keysOf(out));
    EXPECT_EQ((std::vector<int32_t>{1, 0, 2}), seqs(out));
}

TEST_F(NaturalMergeSortTest, RunsThatJoinInAScratchFileCanPassAnEqualEarlierRecord) {
    // Runs [1] [0 3 4] [3]: .a receives [1] and [3], which read back as one
    // run [1 3]; the 3 of seq 4 then meets the 3 of seq 2 from .b and, as a
    // tie, goes first.  The sort is stable within one merge, not overall.
    std::string path = dir.write("f", encode(withKeys({1, 0, 3, 4, 3})));
    ASSERT_TRUE(sortFile(path, 1));
    std::vector<Rec> out = decode(testsupport::readFile(path));
    EXPECT_EQ((std::vector<int32_t>{0, 1, 3, 3, 4}), keysOf(out));
    EXPECT_EQ((std::vector<int32_t>{1, 0, 4, 2, 3}), seqs(out));
}

TEST_F(NaturalMergeSortTest, DescendingOrderSortsFromLargest) {
    std::string path = dir.write("f", encode(withKeys({2, 9, 4, 4, 7, 1})));
    ASSERT_TRUE(sortFile(path, 2));
    EXPECT_EQ((std::vector<int32_t>{9, 7, 4, 4, 2, 1}), keysOf(decode(testsupport::readFile(path))));
}

TEST_F(NaturalMergeSortTest, OrderZeroOrThreeReturnsFalseAndLeavesFileAlone) {
    std::string bytes = encode(withKeys({3, 1, 2}));
    std::string path = dir.write("f", bytes);
    EXPECT_FALSE(sortFile(path, 0));
    EXPECT_FALSE(sortFile(path, 3));
    EXPECT_EQ(bytes, testsupport::readFile(path));
    EXPECT_EQ(0, g_reads);
    EXPECT_FALSE(testsupport::fileExists(path + ".a"));
    EXPECT_FALSE(testsupport::fileExists(path + ".b"));
}

TEST_F(NaturalMergeSortTest, NoScratchFileRemainsAfterANormalEnd) {
    std::string path = dir.write("f", encode(withKeys({3, 1, 2, 0, 5})));
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_FALSE(testsupport::fileExists(path + ".a"));
    EXPECT_FALSE(testsupport::fileExists(path + ".b"));
    EXPECT_EQ((std::vector<int32_t>{0, 1, 2, 3, 5}), keysOf(decode(testsupport::readFile(path))));
}

TEST_F(NaturalMergeSortTest, EmptyFileProducesNoRunAndStaysEmpty) {
    std::string path = dir.write("empty", "");
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_TRUE(testsupport::fileExists(path));
    EXPECT_EQ("", testsupport::readFile(path));
    EXPECT_EQ(0, g_writes);
    EXPECT_FALSE(testsupport::fileExists(path + ".a"));
}

TEST_F(NaturalMergeSortTest, NullNameAndMissingFileReturnFalse) {
    NaturalMergeSort sorter = makeSorter();
    EXPECT_FALSE(sorter.sort(nullptr, 1, true));
    std::wstring missing = wide(dir.file("missing"));
    EXPECT_FALSE(sorter.sort(&missing[0], 1, true));
    EXPECT_FALSE(testsupport::fileExists(dir.file("missing")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("missing.a")));
}

TEST_F(NaturalMergeSortTest, AnyNullCallbackDisablesTheSorter) {
    std::string bytes = encode(withKeys({3, 1, 2}));
    std::string path = dir.write("f", bytes);
    NaturalMergeSort sorter(compareRec, readRec, writeRec, nullptr, freeRec);
    std::wstring name = wide(path);
    EXPECT_FALSE(sorter.sort(&name[0], 1, true));
    EXPECT_EQ(bytes, testsupport::readFile(path));
}

TEST_F(NaturalMergeSortTest, EofComparesPositionWithEndAndKeepsPosition) {
    NaturalMergeSort sorter = makeSorter();
    EXPECT_FALSE(sorter.eof(nullptr));
    AbstractFile* file = openWith(dir, "f", withKeys({1, 2}));
    EXPECT_FALSE(sorter.eof(file));
    ASSERT_TRUE(file->seek(8, SEEK_FROM_START));
    EXPECT_FALSE(sorter.eof(file));
    EXPECT_EQ(8, file->tell());
    ASSERT_TRUE(file->seek(16, SEEK_FROM_START));
    EXPECT_TRUE(sorter.eof(file));
    EXPECT_EQ(16, file->tell());
    delete file;
}

TEST_F(NaturalMergeSortTest, SortTracesItsEntryWithTheFileName) {
    testsupport::TraceCapture capture;
    std::string path = dir.write("traced", encode(withKeys({2, 1})));
    ASSERT_TRUE(sortFile(path, 1));
    EXPECT_TRUE(capture.contains("NaturalMergeSort::sort - entering... [" + path + "]"))
        << capture.dump();
}

TEST_F(NaturalMergeSortTest, RandomKeysSortLikeTheLibraryInBothOrders) {
    std::mt19937 random(12345);
    std::vector<int32_t> keys;
    for (int i = 0; i < 20000; ++i) keys.push_back(static_cast<int32_t>(random() % 5000));
    std::vector<Rec> input = withKeys(keys);
    for (unsigned int order = 1; order <= 2; ++order) {
        std::string path = dir.write("random" + std::to_string(order), encode(input));
        ASSERT_TRUE(sortFile(path, order));
        std::vector<Rec> out = decode(testsupport::readFile(path));
        std::vector<int32_t> expected = keys;
        if (order == 1) {
            std::sort(expected.begin(), expected.end());
        } else {
            std::sort(expected.begin(), expected.end(), std::greater<int32_t>());
        }
        EXPECT_EQ(expected, keysOf(out));
        // Nothing lost or doubled: every sequence number once.
        std::vector<int32_t> s = seqs(out);
        std::sort(s.begin(), s.end());
        for (size_t i = 0; i < s.size(); ++i) ASSERT_EQ(static_cast<int32_t>(i), s[i]);
    }
}

}  // namespace
