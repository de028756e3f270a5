// Damaged inputs that once made a reader crash, hang or read out of bounds,
// each kept as the literal bytes and fed through the same reader as the fuzz
// target that met it.  Every reader must fail cleanly: false, an empty or
// shorter result, a trace where the reader has one.
#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <string>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

std::string bytes(const unsigned char* data, size_t size) {
    return std::string(reinterpret_cast<const char*>(data), size);
}

using testsupport::widen;

// A table "t" in a temp dir, its lock file in a second temp dir.
class DamagedTableTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
    }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore); }

    void writeTable(const std::string& dat, const std::string& pxx) {
        dir.write("t.dat", dat);
        dir.write("t.pxx", pxx);
    }

    // The index list of "t" names one index "i" over field "A"; `idx` is the
    // whole of its file.
    void writeIndexOnA(const std::string& idx) {
        const unsigned char list[] = {110, 0, 0, 0, 4, 0, 0, 0, 'i', 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0};
        dir.write("t_idx.dat", bytes(list, sizeof list));
        dir.write("i.idx", idx);
    }

    // 65536 buckets, every one empty.
    static std::string emptyBuckets() { return std::string(65536 * 8, '\xff'); }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    char savedStore[sizeof LinuxSharedMutex::storePath];
};

// Header: counts 0 and 0, then a field count of 65536: far beyond the 256
// fields a presence bitmap can hold.
TEST_F(DamagedTableTest, OpenRefusesAFieldCountBeyondTheBitmap) {
    const unsigned char dat[] = {0, 0, 0, 0, 0, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};
    writeTable(bytes(dat, sizeof dat), std::string());
    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    EXPECT_FALSE(table.open());
    EXPECT_EQ(0u, table.getFields().count());
    EXPECT_EQ(nullptr, table.getDataFile());
}

// One field of type 5 whose name claims 0x7ffffffc bytes in a 20-byte file.
TEST_F(DamagedTableTest, OpenRefusesAFieldNameRunningPastTheFile) {
    const unsigned char dat[] = {0, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0,
                                 5, 0, 0, 0, 0xfc, 0xff, 0xff, 0x7f};
    writeTable(bytes(dat, sizeof dat), std::string());
    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    EXPECT_FALSE(table.open());
    EXPECT_EQ(nullptr, table.getPointerFile());
}

// Schema: one text field "N".  Record 0 at offset 24: bitmap 0, a text
// length of 65535 and only three bytes behind it.
TEST_F(DamagedTableTest, ReadFailsOnATextLongerThanTheRestOfTheFile) {
    const unsigned char dat[] = {1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 5, 0, 0, 0, 4, 0, 0, 0, 'N', 0, 0, 0,
                                 0x00, 0xff, 0xff, 'a', 'b', 'c'};
    const unsigned char pxx[] = {24, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    Fields record(table.getFields());
    unsigned int id = 99;
    ASSERT_TRUE(table.moveFirst(id));
    EXPECT_EQ(0u, id);
    EXPECT_FALSE(table.read(id, record));
    table.close();
}

// The same schema; slot 0 points at offset 0x00100000 of a 24-byte file.
TEST_F(DamagedTableTest, ReadFailsOnASlotPointingPastTheDataFile) {
    const unsigned char dat[] = {1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 5, 0, 0, 0, 4, 0, 0, 0, 'N', 0, 0, 0};
    const unsigned char pxx[] = {0x00, 0x00, 0x10, 0x00};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    Fields record(table.getFields());
    unsigned int id = 0;
    ASSERT_TRUE(table.moveFirst(id));
    EXPECT_FALSE(table.read(id, record));
    table.close();
}

// Compressed table with one 32-bit field "A": the value is twelve bytes that
// all say "another byte follows", more than any 64-bit number takes.
TEST_F(DamagedTableTest, ReadFailsOnACompressedIntegerThatNeverEnds) {
    const unsigned char dat[] = {1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff};
    const unsigned char pxx[] = {24, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    FS_Table table(L"t", widen(dir.path()).c_str(), true);
    ASSERT_TRUE(table.open());
    Fields record(table.getFields());
    EXPECT_FALSE(table.read(0, record));
    table.close();
}

// The same value cut to a proper end reads back: 300 is 0x05 0x58.
TEST_F(DamagedTableTest, CompressedIntegerWithAnEndStillReads) {
    const unsigned char dat[] = {1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 0x05, 0x58};
    const unsigned char pxx[] = {24, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    FS_Table table(L"t", widen(dir.path()).c_str(), true);
    ASSERT_TRUE(table.open());
    Fields record(table.getFields());
    ASSERT_TRUE(table.read(0, record));
    EXPECT_EQ(300u, static_cast<Int32Field*>(record.at(0))->value());
    table.close();
}

// An index whose overflow slot 65536 holds record 1, which was removed, and
// chains on to itself.  The lookup used to go round that loop half a
// billion times; it now ends at once with false and the chain is over.
TEST_F(DamagedTableTest, IndexChainLoopOverRemovedRecordsEndsTheLookup) {
    const unsigned char dat[] = {1, 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 7, 0, 0, 0, 0x00, 8, 0, 0, 0};
    const unsigned char pxx[] = {24, 0, 0, 0, 0, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    const unsigned char loop[] = {1, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};  // slot 65536: record 1, next 65536
    writeIndexOnA(emptyBuckets() + bytes(loop, sizeof loop));

    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    ASSERT_EQ(1u, table.getIndexes().size());
    Index& index = *table.getIndexes()[0];
    unsigned int id = 42;
    unsigned int next = 65536;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(table.hashIndex_moveNext(index, id, next));
    auto elapsed = std::chrono::steady_clock::now() - start;
    EXPECT_EQ(42u, id);
    EXPECT_EQ(0xffffffffu, next);
    EXPECT_LT(std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count(), 1000);
    table.close();
}

// A sound chain falls from slot to slot: 65537 holds record 1, removed, and
// leads on to 65536, which holds record 0.  The walk passes the removed
// record and finds the live one, as it always did.
TEST_F(DamagedTableTest, IndexChainThroughARemovedRecordStillFindsTheLiveOne) {
    const unsigned char dat[] = {1, 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 7, 0, 0, 0, 0x00, 8, 0, 0, 0};
    const unsigned char pxx[] = {24, 0, 0, 0, 0, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    // slot 65536: record 0, end; slot 65537: record 1, next 65536.
    const unsigned char chain[] = {0, 0, 0, 0, 0xff, 0xff, 0xff, 0xff, 1, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};
    writeIndexOnA(emptyBuckets() + bytes(chain, sizeof chain));

    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    ASSERT_EQ(1u, table.getIndexes().size());
    unsigned int id = 42;
    unsigned int next = 65537;
    EXPECT_TRUE(table.hashIndex_moveNext(*table.getIndexes()[0], id, next));
    EXPECT_EQ(0u, id);
    EXPECT_EQ(0xffffffffu, next);
    table.close();
}

// Two live records chained in a ring: 65536 (record 0) leads up to 65537
// (record 1), which leads back down to 65536.  A cursor that follows such a
// ring would hand out the same two records for ever.  The climbing link ends
// the chain: record 0 comes once, then the chain is over.
TEST_F(DamagedTableTest, IndexChainLinkThatClimbsEndsTheChain) {
    const unsigned char dat[] = {2, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 7, 0, 0, 0, 0x00, 8, 0, 0, 0};
    const unsigned char pxx[] = {24, 0, 0, 0, 29, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    const unsigned char ring[] = {0, 0, 0, 0, 0x01, 0x00, 0x01, 0x00, 1, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};
    writeIndexOnA(emptyBuckets() + bytes(ring, sizeof ring));

    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    ASSERT_EQ(1u, table.getIndexes().size());
    Index& index = *table.getIndexes()[0];
    unsigned int id = 42;
    unsigned int next = 65536;
    ASSERT_TRUE(table.hashIndex_moveNext(index, id, next));
    EXPECT_EQ(0u, id);
    EXPECT_EQ(0xffffffffu, next);
    EXPECT_FALSE(table.hashIndex_moveNext(index, id, next));
    EXPECT_EQ(0u, id);
    table.close();
}

// Records 0 and 1 both hold A = 7.  Bucket 2035 (the bucket of "7") leads
// to slot 65536 (record 1), which climbs to 65537 (record 0), which leads
// back to 65536.  A cursor with the criteria [A]==7 walks the index and used
// to hand out records 1 and 0 in turn for ever; the climbing link now ends
// the chain, so the cursor gives record 0 and record 1 once each and stops.
TEST_F(DamagedTableTest, CursorOverAnIndexRingStops) {
    const unsigned char dat[] = {2, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 7, 0, 0, 0, 0x00, 7, 0, 0, 0};
    const unsigned char pxx[] = {24, 0, 0, 0, 29, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    std::string idx = emptyBuckets();
    const unsigned char bucket[] = {0, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};  // record 0, next 65536
    idx.replace(2035 * 8, 8, bytes(bucket, sizeof bucket));
    const unsigned char ring[] = {1, 0, 0, 0, 0x01, 0x00, 0x01, 0x00,   // 65536: record 1, next 65537
                                  0, 0, 0, 0, 0x00, 0x00, 0x01, 0x00};  // 65537: record 0, next 65536
    writeIndexOnA(idx + bytes(ring, sizeof ring));

    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    ASSERT_EQ(1u, table.getIndexes().size());
    CriteriaEvaluator criteria(L"[A]==7");
    RecordSet cursor = table.openRecordSet();
    cursor.setCriteria(&criteria, false);
    ASSERT_TRUE(cursor.get()->isIndexNavigation());
    unsigned int yielded = 0;
    for (bool more = cursor.moveFirst(); more && yielded < 100; more = cursor.moveNext()) {
        EXPECT_EQ(7u, cursor.getFieldAsInt32(L"A"));
        ++yielded;
    }
    EXPECT_EQ(2u, yielded);
    table.closeRecordSet(cursor);
    table.close();
}

// A chain that leads from an overflow slot back into the buckets is damaged
// as well: the buckets are never anybody's continuation.
TEST_F(DamagedTableTest, IndexChainIntoTheBucketsEndsTheChain) {
    const unsigned char dat[] = {1, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 3, 0, 0, 0, 4, 0, 0, 0, 'A', 0, 0, 0,
                                 0x00, 7, 0, 0, 0};
    const unsigned char pxx[] = {24, 0, 0, 0};
    writeTable(bytes(dat, sizeof dat), bytes(pxx, sizeof pxx));
    std::string idx = emptyBuckets();
    // Bucket 5 holds record 0 and leads to bucket 5 again.
    const unsigned char bucket[] = {0, 0, 0, 0, 5, 0, 0, 0};
    idx.replace(5 * 8, 8, bytes(bucket, sizeof bucket));
    writeIndexOnA(idx);

    FS_Table table(L"t", widen(dir.path()).c_str(), false);
    ASSERT_TRUE(table.open());
    unsigned int id = 42;
    unsigned int next = 5;
    EXPECT_FALSE(table.hashIndex_moveNext(*table.getIndexes()[0], id, next));
    EXPECT_EQ(42u, id);
    EXPECT_EQ(0xffffffffu, next);
    table.close();
}

// ---- result files ------------------------------------------------------------

// A path whose count promises 0x7fffffff bytes in an 8-byte file.
TEST(DamagedResultFileTest, StringCountBeyondTheFileEndsReadingCleanly) {
    testsupport::TempDir dir;
    const unsigned char file[] = {0x7f, 0xff, 0xff, 0xff, 'a', 'b', 'c', 'd'};
    std::string path = dir.write("results", bytes(file, sizeof file));
    testsupport::TraceCapture capture;
    FsResultSetReader_OnFile reader(path.c_str());
    reader.moveFirst();
    FsFileInfo info;
    EXPECT_EQ(0, reader.getNext(info));
    EXPECT_TRUE(capture.contains("runs past the end of the file")) << capture.dump();
}

// Record "/" "a" with empty sums and mask 0, then a path count of 478 that
// the file cannot hold, then another whole record "/" "b".  A reader stops
// at the damage after one record.  The sort used to step over the four
// bytes of the bad count and take the rest for a record of its own, so the
// sorted file held two records; it now ends its input at the damage too.
TEST(DamagedResultFileTest, SortEndsItsInputAtDamageLikeTheReader) {
    testsupport::TempDir dir;
    const unsigned char file[] = {0, 0, 0, 2, '/', 0, 0, 0, 2, 'a', 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0,
                                  0, 0, 1, 0xde,
                                  0, 0, 0, 2, '/', 0, 0, 0, 2, 'b', 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0};
    std::string path = dir.write("results", bytes(file, sizeof file));
    FsResultSetReader_OnFile reader(path.c_str());
    reader.moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_EQ(0, reader.getNext(info));

    EXPECT_EQ(1, reader.sort(2, 1, false));
    reader.moveFirst();
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_STREQ(L"a", info.getName());
    EXPECT_EQ(0, reader.getNext(info));
    // The sorted file holds exactly the one whole record.
    EXPECT_EQ(bytes(file, 22), testsupport::readFile(path));
}

// The input the result file target first failed on (sort by size,
// ascending): one whole record, then a string count of 478 that runs past the
// end.  The reader sees one record; the sort used to make three of it.
const unsigned char kSortInventedRecords[] = {
    0x00, 0x00, 0x00, 0x07, 0x2f, 0x64, 0x61, 0x74, 0x61, 0x2f, 0x00, 0x00, 0x00, 0x0b, 0x72, 0x65,
    0x70, 0x6f, 0x72, 0x74, 0x2e, 0x74, 0x78, 0x74, 0x00, 0x00, 0x00, 0x21, 0x64, 0x34, 0x31, 0x64,
    0x38, 0x63, 0x64, 0x39, 0x38, 0x66, 0x30, 0x30, 0x62, 0x32, 0x30, 0x34, 0x65, 0x39, 0x38, 0x30,
    0x30, 0x39, 0x39, 0x38, 0x64, 0x63, 0x66, 0x38, 0x34, 0x32, 0x37, 0x65, 0x00, 0x00, 0x00, 0x01,
    0x00, 0x00, 0x0f, 0x3b, 0x00, 0x00, 0x00, 0x20, 0x00, 0x00, 0x00, 0x00, 0x00, 0x00, 0x30, 0x39,
    0x00, 0x00, 0x08, 0x01, 0x00, 0x00, 0x00, 0x64, 0x00, 0x00, 0x03, 0xe8, 0x00, 0x00, 0x00, 0x4d,
    0x65, 0x53, 0xf1, 0x00, 0x5f, 0x5e, 0x10, 0x00, 0x62, 0x59, 0x00, 0x80, 0x00, 0x00, 0x00, 0x01,
    0xde, 0xad, 0xbe, 0xef, 0x00, 0x07, 0x00, 0x07, 0x00, 0x00, 0x00, 0x02, 0x2f, 0x00, 0x00, 0x00,
    0x02, 0x61, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x02, 0x00, 0x00,
    0x00, 0x00, 0x00, 0x00, 0x00, 0x05, 0x00, 0x00, 0x00, 0xcf, 0x2f, 0x73, 0x72, 0x76, 0x2f, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78,
    0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x78, 0x2f, 0x00, 0x00, 0x00, 0x14, 0xc3, 0x9c, 0x6e, 0xc3,
    0xaf, 0x63, 0xc3, 0xb6, 0x64, 0xc3, 0xa9, 0x20, 0xe2, 0x9c, 0x93, 0x2e, 0x74, 0x78, 0x74, 0x00,
    0x00, 0x00, 0x01, 0x00, 0x00, 0x00, 0x01, 0x00, 0x00, 0x01, 0x02, 0x00, 0x00, 0x00, 0x00, 0x00,
    0x00, 0x00, 0x63, 0x59, 0x68, 0x2f, 0x00,
};

TEST(DamagedResultFileTest, FuzzedFileSortsIntoNoMoreRecordsThanTheReaderSees) {
    testsupport::TempDir dir;
    std::string path = dir.write("results", bytes(kSortInventedRecords, sizeof kSortInventedRecords));
    FsResultSetReader_OnFile reader(path.c_str());
    reader.moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_STREQ(L"report.txt", info.getName());
    EXPECT_EQ(0, reader.getNext(info));

    EXPECT_EQ(1, reader.sort(4, 1, false));
    reader.moveFirst();
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_STREQ(L"/data/", info.getPath());
    EXPECT_STREQ(L"report.txt", info.getName());
    EXPECT_EQ(0, reader.getNext(info));
}

// The same records without the damage sort as ever: "b" before "a" when
// descending by name.
TEST(DamagedResultFileTest, SortOfWholeRecordsIsUnchanged) {
    testsupport::TempDir dir;
    const unsigned char file[] = {0, 0, 0, 2, '/', 0, 0, 0, 2, 'a', 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0,
                                  0, 0, 0, 2, '/', 0, 0, 0, 2, 'b', 0, 0, 0, 1, 0, 0, 0, 1, 0, 0, 0, 0};
    std::string path = dir.write("results", bytes(file, sizeof file));
    FsResultSetReader_OnFile reader(path.c_str());
    EXPECT_EQ(1, reader.sort(2, 2, false));
    reader.moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_STREQ(L"b", info.getName());
    ASSERT_EQ(1, reader.getNext(info));
    EXPECT_STREQ(L"a", info.getName());
    EXPECT_EQ(0, reader.getNext(info));
}

// ---- ex_hash and cat_set -------------------------------------------------------

class DamagedCacheFilesTest : public ::testing::Test {
protected:
    DamagedCacheFilesTest() {
        glue = testsupport::plainGlue();
    }
    testsupport::TempDir dir;
    FsGlue glue;
};

// One good record ("/a", digest 00..0f), then a key length of 65536.
TEST_F(DamagedCacheFilesTest, ExHashKeyLengthOverTheLimitStopsReading) {
    const unsigned char file[] = {2, 0, 0, 0, '/', 'a', 0, 1, 2, 3, 4, 5, 6, 7, 8, 9, 10, 11, 12, 13, 14, 15,
                                  0x00, 0x00, 0x01, 0x00, 'x', 'y'};
    dir.write("ex_hash", bytes(file, sizeof file));
    FS_Cache2 cache(L"dirs", L"files", widen(dir.path()).c_str(), true, false, &glue, L"p");
    testsupport::TraceCapture capture;
    cache.readMd5OfExclude();
    ASSERT_EQ(1u, cache.excludeMd5.size());
    ASSERT_EQ(1u, cache.excludeMd5.count("/a"));
    EXPECT_EQ(1u, cache.excludeMd5["/a"].valid);
    EXPECT_TRUE(capture.contains("damaged record length 65536")) << capture.dump();
}

// One good record "ab", then a count of 0x40000000 characters.
TEST_F(DamagedCacheFilesTest, CatSetCountOverTheBufferStopsReading) {
    const unsigned char file[] = {2, 0, 0, 0, 'a', 0, 0, 0, 'b', 0, 0, 0, 0x00, 0x00, 0x00, 0x40, 'c', 0, 0, 0};
    dir.write("cat_set", bytes(file, sizeof file));
    FS_Cache2 cache(L"dirs", L"files", widen(dir.path()).c_str(), true, false, &glue, L"p");
    FsQuery query;
    testsupport::TraceCapture capture;
    cache.saveOrRestoreFilesOrMasksForCaching(query);
    EXPECT_EQ(1u, query.getFileOrMaskForCachingSetSize());
    EXPECT_EQ(1u, query.getFilesForCaching().count(L"ab"));
    EXPECT_TRUE(capture.contains("damaged record of 1073741824 characters")) << capture.dump();
}

}  // namespace
