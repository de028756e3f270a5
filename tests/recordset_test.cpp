#include "fscanner/fscommon/recordset.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>
#include <string>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

// 8-byte index slot as stored: record number, then next slot, host order.
std::string slot(uint32_t id, uint32_t next) {
    std::string out(8, '\0');
    std::memcpy(&out[0], &id, 4);
    std::memcpy(&out[4], &next, 4);
    return out;
}

// An index file of 65536 empty buckets.
std::string emptyBuckets() { return std::string(65536u * 8u, static_cast<char>(0xFF)); }

void overwrite(const std::string& path, const std::string& data) {
    FILE* f = fopen(path.c_str(), "wb");
    ASSERT_NE(nullptr, f);
    ASSERT_EQ(data.size(), fwrite(data.data(), 1, data.size(), f));
    fclose(f);
}

std::string numbersOf(RecordSet& rs) {
    std::string seen;
    for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) {
        if (!seen.empty()) seen += ",";
        seen += std::to_string(rs.getFieldAsInt32(L"N"));
    }
    return seen;
}

class RecordSetTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
        t.reset(new FS_Table(L"people", wdir.c_str(), false));
        t->addField(L"N", FIELD_INT32);
        t->addField(L"S", FIELD_TEXT);
        t->addField(L"W", FIELD_INT64);
        // create() leaves the table open.
        ASSERT_TRUE(t->create());
    }
    void TearDown() override {
        t.reset();
        std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore);
    }

    void add(RecordSet& rs, unsigned int n, const wchar_t* s) {
        rs.setFieldAsInt32(L"N", n);
        rs.setFieldAsString(L"S", s);
        rs.setFieldAsInt64(L"W", 1000000000000ull + n);
        ASSERT_TRUE(rs.insert());
    }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[sizeof LinuxSharedMutex::storePath];
    std::unique_ptr<FS_Table> t;
};

TEST(RecordSetHandle, EmptyHandleGivesZeroAndMinus21) {
    RecordSet rs;
    EXPECT_TRUE(rs.isEmpty());
    EXPECT_EQ(0u, rs.count());
    EXPECT_EQ(-21, rs.lock(5));
    EXPECT_EQ(-21, rs.unlock());
    EXPECT_FALSE(rs.moveFirst());
    EXPECT_FALSE(rs.moveNext());
    EXPECT_FALSE(rs.movePrevious());
    EXPECT_FALSE(rs.moveLast());
    EXPECT_FALSE(rs.read());
    EXPECT_FALSE(rs.insert());
    EXPECT_FALSE(rs.setCriteria(nullptr, false));
    EXPECT_EQ(nullptr, rs.getFieldAsString(0u));
    EXPECT_EQ(0u, rs.getFieldAsInt32(L"N"));
    testsupport::TraceCapture capture;
    rs.printFields();
    EXPECT_EQ(0u, capture.messages().size()) << capture.dump();
}

TEST(RecordSetHandle, CursorWithoutTableRefusesStoreOperations) {
    __recordSet cursor;
    EXPECT_FALSE(cursor.read());
    EXPECT_FALSE(cursor.insert());
    EXPECT_FALSE(cursor.update());
    EXPECT_FALSE(cursor.remove());
    EXPECT_FALSE(cursor.moveFirst());
    EXPECT_EQ(0u, cursor.count());
    EXPECT_EQ(-21, cursor.lock(5));
    EXPECT_EQ(-21, cursor.unlock());
}

TEST_F(RecordSetTest, EmptyTableMoveFirstFalseCountZero) {
    RecordSet rs = t->openRecordSet();
    ASSERT_FALSE(rs.isEmpty());
    EXPECT_FALSE(rs.moveFirst());
    EXPECT_EQ(0u, rs.count());
    EXPECT_FALSE(rs.moveLast());
    EXPECT_EQ(0u, rs.get()->getId());
    EXPECT_EQ(0u, rs.get()->getPosition());
}

TEST_F(RecordSetTest, CountIsLiveRecordsMinusOneAndZeroForOne) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    EXPECT_EQ(0u, rs.count());
    add(rs, 2, L"b");
    add(rs, 3, L"c");
    EXPECT_EQ(2u, rs.count());
    ASSERT_TRUE(t->remove(1));
    EXPECT_EQ(1u, rs.count());
}

TEST_F(RecordSetTest, WalkReadsEveryLiveRecordInOrder) {
    RecordSet rs = t->openRecordSet();
    add(rs, 10, L"ten");
    add(rs, 20, L"twenty");
    add(rs, 30, L"thirty");
    ASSERT_TRUE(t->remove(1));
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(10u, rs.getFieldAsInt32(L"N"));
    EXPECT_STREQ(L"ten", rs.getFieldAsString(1u));
    EXPECT_EQ(1000000000010ull, rs.getFieldAsInt64(L"W"));
    EXPECT_EQ(0u, rs.get()->getPosition());
    ASSERT_TRUE(rs.moveNext());
    EXPECT_EQ(30u, rs.getFieldAsInt32(0u));
    EXPECT_EQ(2u, rs.get()->getId());
    EXPECT_EQ(1u, rs.get()->getPosition());
    EXPECT_FALSE(rs.moveNext());
}

TEST_F(RecordSetTest, MovePreviousWalksBackAndDecrementsPosition) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    ASSERT_TRUE(rs.moveFirst());
    ASSERT_TRUE(rs.moveNext());
    ASSERT_TRUE(rs.movePrevious());
    EXPECT_EQ(1u, rs.getFieldAsInt32(L"N"));
    EXPECT_EQ(0u, rs.get()->getPosition());
    EXPECT_EQ(0u, rs.get()->getId());
}

TEST_F(RecordSetTest, MoveLastAlwaysFalseButNumberNamesLastRecord) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    add(rs, 3, L"c");
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_FALSE(rs.moveLast());
    // Buffer untouched, number moved.
    EXPECT_EQ(1u, rs.getFieldAsInt32(L"N"));
    EXPECT_EQ(2u, rs.get()->getId());
    EXPECT_EQ(2u, rs.get()->getPosition());
    ASSERT_TRUE(rs.read());
    EXPECT_EQ(3u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, UpdateThroughCursorAndWalkOnFromMovedRecord) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    ASSERT_TRUE(rs.moveFirst());
    rs.setFieldAsString(L"S", L"longer");
    ASSERT_TRUE(rs.update());
    // The record moved to number 2; the cursor still names slot 0.
    EXPECT_EQ(0u, rs.get()->getId());
    ASSERT_TRUE(rs.moveNext());
    EXPECT_EQ(2u, rs.getFieldAsInt32(L"N"));
    ASSERT_TRUE(rs.moveNext());
    EXPECT_STREQ(L"longer", rs.getFieldAsString(L"S"));
    EXPECT_FALSE(rs.moveNext());
}

TEST_F(RecordSetTest, RemoveThroughCursor) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    ASSERT_TRUE(rs.moveFirst());
    ASSERT_TRUE(rs.remove());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(2u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, CriteriaWithoutIndexWalkAndFilter) {
    RecordSet rs = t->openRecordSet();
    for (unsigned int i = 0; i < 10; ++i) add(rs, i, i % 2 ? L"odd" : L"even");
    CriteriaEvaluator e(L"[S]==\"odd\"");
    ASSERT_TRUE(rs.setCriteria(&e, true));
    EXPECT_FALSE(rs.get()->isIndexNavigation());
    std::string seen;
    for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) seen += std::to_string(rs.getFieldAsInt32(L"N"));
    EXPECT_EQ("13579", seen);
    EXPECT_EQ(4u, rs.get()->getPosition());
    // Criteria do not change count.
    EXPECT_EQ(9u, rs.count());
    ASSERT_TRUE(rs.moveFirst());
    ASSERT_TRUE(rs.moveNext());
    ASSERT_TRUE(rs.movePrevious());
    EXPECT_EQ(1u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, TextIndexFindsValueWhateverCaseOfCriteria) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"Alpha");
    add(rs, 2, L"beta");
    add(rs, 3, L"alpha");
    ASSERT_TRUE(t->addHashIndex(L"byS", L"S"));
    CriteriaEvaluator e(L"[S]==\"ALPHA\"");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    std::string seen;
    for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) seen += std::to_string(rs.getFieldAsInt32(L"N"));
    // Chains hold the newest entry first.
    EXPECT_EQ("31", seen);
    // Every match through the chain counts in the position.
    EXPECT_EQ(1u, rs.get()->getPosition());
    EXPECT_EQ(0u, rs.get()->getId());

    CriteriaEvaluator exact(L"[S]==\"ALPHA\"");
    ASSERT_TRUE(rs.setCriteria(&exact, true));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    EXPECT_FALSE(rs.moveFirst());

    CriteriaEvaluator lower(L"[S]==\"alpha\"");
    ASSERT_TRUE(rs.setCriteria(&lower, true));
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(3u, rs.getFieldAsInt32(L"N"));
    EXPECT_FALSE(rs.moveNext());
}

TEST_F(RecordSetTest, TwoValuesInOneBucketOnlyCheckedOneReturned) {
    // Find a second number whose decimal key lands in the bucket of 7.
    int bucket = hash(L"7", Index::BUCKETS);
    unsigned int other = 0;
    wchar_t text[16];
    for (unsigned int v = 8; v < 10000000u; ++v) {
        if (hash(wcs_itoa(v, text), Index::BUCKETS) == bucket) {
            other = v;
            break;
        }
    }
    ASSERT_NE(0u, other);
    RecordSet rs = t->openRecordSet();
    add(rs, 7, L"seven");
    add(rs, other, L"other");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    CriteriaEvaluator e(L"[N]==7");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_STREQ(L"seven", rs.getFieldAsString(L"S"));
    EXPECT_FALSE(rs.moveNext());
}

TEST_F(RecordSetTest, IndexNavigationRefusesBackwardMovesUntilCriteriaCleared) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    CriteriaEvaluator e(L"[N]==2");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_FALSE(rs.movePrevious());
    EXPECT_FALSE(rs.moveLast());
    ASSERT_TRUE(rs.setCriteria(nullptr, false));
    EXPECT_FALSE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.movePrevious());
    EXPECT_EQ(1u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, IndexLookupSkipsRemovedRecords) {
    RecordSet rs = t->openRecordSet();
    add(rs, 5, L"a");
    add(rs, 5, L"b");
    add(rs, 5, L"c");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    ASSERT_TRUE(t->remove(2));
    ASSERT_TRUE(t->remove(0));
    CriteriaEvaluator e(L"[N]==5");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_STREQ(L"b", rs.getFieldAsString(L"S"));
    EXPECT_EQ(1u, rs.get()->getId());
    EXPECT_FALSE(rs.moveNext());
    // The entries of the removed records still stand in the file: the chain
    // is 2, 1, 0 from the bucket of "5".
    ASSERT_TRUE(t->close());
    std::string data = testsupport::readFile(dir.file("byN.idx"));
    unsigned int bucket = static_cast<unsigned int>(hash(L"5", Index::BUCKETS));
    EXPECT_EQ(1961u, bucket);
    ASSERT_EQ(65538u * 8u, data.size());
    EXPECT_EQ(slot(2, 65537), data.substr(bucket * 8, 8));
    EXPECT_EQ(slot(1, 65536), data.substr(65537u * 8, 8));
    EXPECT_EQ(slot(0, 0xFFFFFFFFu), data.substr(65536u * 8, 8));
}

TEST_F(RecordSetTest, EmptyCriteriaTextEndsFiltering) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"a");
    add(rs, 2, L"b");
    CriteriaEvaluator e(L"");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.moveFirst());
    ASSERT_TRUE(rs.moveNext());
    EXPECT_EQ(2u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, LockAndUnlockGoToTheTable) {
    RecordSet rs = t->openRecordSet();
    EXPECT_EQ(0, rs.lock(5));
    EXPECT_EQ(0, rs.unlock());
}

TEST_F(RecordSetTest, CloseRecordSetDeletesAndClearsHandle) {
    RecordSet rs = t->openRecordSet();
    RecordSet copy = rs;
    EXPECT_TRUE(t->closeRecordSet(rs));
    EXPECT_TRUE(rs.isEmpty());
    copy.clear();
    RecordSet foreign(nullptr);
    EXPECT_FALSE(t->closeRecordSet(foreign));
    __recordSet local(t.get());
    RecordSet notOwned(&local);
    EXPECT_FALSE(t->closeRecordSet(notOwned));
}

TEST_F(RecordSetTest, TableCloseAndDestructorDeleteOpenCursors) {
    // Leak checks under the sanitizers pin the deletion.
    RecordSet a = t->openRecordSet();
    RecordSet b = t->openRecordSet();
    add(a, 1, L"a");
    EXPECT_EQ(0u, b.count());
    EXPECT_TRUE(t->close());
    ASSERT_TRUE(t->open());
    RecordSet c = t->openRecordSet();
    ASSERT_TRUE(c.moveFirst());
    EXPECT_STREQ(L"a", c.getFieldAsString(L"S"));
    t.reset();
}

TEST_F(RecordSetTest, PrintFieldsTracesEveryFieldAtMostDetailedLevel) {
    RecordSet rs = t->openRecordSet();
    add(rs, 42, L"hello");
    ASSERT_TRUE(rs.moveFirst());
    testsupport::TraceCapture capture;
    rs.printFields();
    EXPECT_TRUE(capture.contains("N = 42")) << capture.dump();
    EXPECT_TRUE(capture.contains("S = hello")) << capture.dump();
    EXPECT_EQ(1u, capture.count("W = ")) << capture.dump();
}

TEST_F(RecordSetTest, IndexSlotPastEndOfDataStopsCleanly) {
    RecordSet rs = t->openRecordSet();
    add(rs, 9, L"a");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    // Point the head of 9's bucket at a record number far past the pointer file.
    std::string path = dir.file("byN.idx");
    std::string data = testsupport::readFile(path);
    unsigned int bucket = static_cast<unsigned int>(hash(L"9", Index::BUCKETS));
    ASSERT_GE(data.size(), (bucket + 1) * 8u);
    uint32_t far = 5000;
    std::memcpy(&data[bucket * 8], &far, 4);
    uint32_t end = 0xFFFFFFFFu;
    std::memcpy(&data[bucket * 8 + 4], &end, 4);
    ASSERT_TRUE(t->close());
    overwrite(path, data);
    ASSERT_TRUE(t->open());
    RecordSet again = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==9");
    ASSERT_TRUE(again.setCriteria(&e, false));
    ASSERT_TRUE(again.get()->isIndexNavigation());
    EXPECT_FALSE(again.moveFirst());
}

TEST(RecordSetHash, NegativeAccumulatorTakesTheSignedRemainderPlusBuckets) {
    // "ZZZZZZZ" wraps the accumulator to -2009485610.  With 65536 buckets the
    // signed and unsigned remainders agree; 1000 buckets tell them apart.
    EXPECT_EQ(44758, hash(L"ZZZZZZZ", 65536));
    EXPECT_EQ(390, hash(L"ZZZZZZZ", 1000));
    EXPECT_EQ(999, hash(0xFFFFFFFFu, 1000));
    EXPECT_EQ(0, hash(L"", 65536));
    EXPECT_EQ(2405, hash(L"A", 65536));
}

TEST_F(RecordSetTest, IndexFileAfterThreeInsertsIntoOneBucketIsByteExact) {
    ASSERT_TRUE(t->addHashIndex(L"byS", L"S"));
    const std::string path = dir.file("byS.idx");
    // All three spellings are keyed "ALPHA", bucket 38686.
    const unsigned int bucket = static_cast<unsigned int>(hash(L"ALPHA", Index::BUCKETS));
    ASSERT_EQ(38686u, bucket);
    const wchar_t* spellings[] = {L"alpha", L"Alpha", L"ALPHA"};
    std::string expected[3];
    expected[0] = emptyBuckets();
    expected[0].replace(bucket * 8, 8, slot(0, 0xFFFFFFFFu));
    // The second write moves the old head to the first overflow slot.
    expected[1] = emptyBuckets() + slot(0, 0xFFFFFFFFu);
    expected[1].replace(bucket * 8, 8, slot(1, 65536));
    // The third moves it again, to a new slot that chains to the first.
    expected[2] = emptyBuckets() + slot(0, 0xFFFFFFFFu) + slot(1, 65536);
    expected[2].replace(bucket * 8, 8, slot(2, 65537));

    ASSERT_TRUE(t->close());
    EXPECT_EQ(emptyBuckets(), testsupport::readFile(path));
    for (int i = 0; i < 3; ++i) {
        ASSERT_TRUE(t->open());
        RecordSet rs = t->openRecordSet();
        add(rs, static_cast<unsigned int>(i), spellings[i]);
        ASSERT_TRUE(t->close());
        std::string data = testsupport::readFile(path);
        ASSERT_EQ(expected[i].size(), data.size()) << "after insert " << i;
        EXPECT_TRUE(expected[i] == data) << "after insert " << i;
    }
    EXPECT_EQ(524304u, testsupport::readFile(path).size());

    ASSERT_TRUE(t->open());
    RecordSet rs = t->openRecordSet();
    CriteriaEvaluator e(L"[S]==\"alpha\"");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    // Newest first.
    EXPECT_EQ("2,1,0", numbersOf(rs));
}

TEST_F(RecordSetTest, CriteriaOnAnUnindexedColumnWalkTheTableWhileAnotherColumnHasAnIndex) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"x");
    add(rs, 2, L"y");
    add(rs, 3, L"x");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    CriteriaEvaluator e(L"[S]==\"x\"");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    EXPECT_FALSE(rs.get()->isIndexNavigation());
    EXPECT_EQ("1,3", numbersOf(rs));
    // Backward moves work on a table walk, and check still filters.
    ASSERT_TRUE(rs.moveFirst());
    ASSERT_TRUE(rs.moveNext());
    EXPECT_EQ(2u, rs.get()->getId());
    ASSERT_TRUE(rs.movePrevious());
    EXPECT_EQ(0u, rs.get()->getId());
    EXPECT_EQ(1u, rs.getFieldAsInt32(L"N"));
}

TEST_F(RecordSetTest, DisjunctionMakesNoIndexLookupAndConjunctionKeepsIt) {
    RecordSet rs = t->openRecordSet();
    add(rs, 1, L"x");
    add(rs, 2, L"y");
    add(rs, 3, L"x");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    CriteriaEvaluator either(L"[N]==1 || [S]==\"y\"");
    ASSERT_TRUE(rs.setCriteria(&either, false));
    EXPECT_FALSE(rs.get()->isIndexNavigation());
    EXPECT_EQ("1,2", numbersOf(rs));
    CriteriaEvaluator both(L"[N]==3 && [S]==\"x\"");
    ASSERT_TRUE(rs.setCriteria(&both, false));
    EXPECT_TRUE(rs.get()->isIndexNavigation());
    EXPECT_EQ("3", numbersOf(rs));
}

TEST_F(RecordSetTest, ChainSlotPastTheEndOfTheIndexFileEndsTheLookup) {
    RecordSet rs = t->openRecordSet();
    add(rs, 9, L"a");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    ASSERT_TRUE(t->close());
    std::string path = dir.file("byN.idx");
    std::string data = testsupport::readFile(path);
    unsigned int bucket = static_cast<unsigned int>(hash(L"9", Index::BUCKETS));
    ASSERT_EQ(slot(0, 0xFFFFFFFFu), data.substr(bucket * 8, 8));
    data.replace(bucket * 8, 8, slot(0, 900000));
    overwrite(path, data);
    ASSERT_TRUE(t->open());
    RecordSet again = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==9");
    ASSERT_TRUE(again.setCriteria(&e, false));
    ASSERT_TRUE(again.moveFirst());
    EXPECT_STREQ(L"a", again.getFieldAsString(L"S"));
    EXPECT_FALSE(again.moveNext());
    EXPECT_EQ(0u, again.get()->getId());
}

TEST_F(RecordSetTest, RemovedHeadWithChainPastTheEndFindsNothing) {
    RecordSet rs = t->openRecordSet();
    add(rs, 9, L"a");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    ASSERT_TRUE(t->remove(0));
    ASSERT_TRUE(t->close());
    std::string path = dir.file("byN.idx");
    std::string data = testsupport::readFile(path);
    unsigned int bucket = static_cast<unsigned int>(hash(L"9", Index::BUCKETS));
    data.replace(bucket * 8, 8, slot(0, 0x7FFFFFFEu));
    overwrite(path, data);
    ASSERT_TRUE(t->open());
    RecordSet again = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==9");
    ASSERT_TRUE(again.setCriteria(&e, false));
    EXPECT_FALSE(again.moveFirst());
}

TEST_F(RecordSetTest, PointerSlotPastTheEndOfTheDataFileEndsTheLookup) {
    RecordSet rs = t->openRecordSet();
    add(rs, 9, L"a");
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    ASSERT_TRUE(t->close());
    // Record 0's slot now names an offset far behind the data.
    std::string pointers = testsupport::readFile(dir.file("people.pxx"));
    ASSERT_EQ(4u, pointers.size());
    uint32_t far = 0x7FFFFF00u;
    std::memcpy(&pointers[0], &far, 4);
    overwrite(dir.file("people.pxx"), pointers);
    ASSERT_TRUE(t->open());
    RecordSet again = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==9");
    ASSERT_TRUE(again.setCriteria(&e, false));
    ASSERT_TRUE(again.get()->isIndexNavigation());
    EXPECT_FALSE(again.moveFirst());
    ASSERT_TRUE(again.setCriteria(nullptr, false));
    EXPECT_FALSE(again.moveFirst());
}

}  // namespace

// The cache's lookups of the form "[column]==variable" on two INT32s are
// decided by the cursor (compareInt32) instead of the evaluator: on a walk
// and on a hash chain, for values in one bucket, at the ends of the range,
// absent, and with a null on either side, the records are the same.
TEST_F(RecordSetTest, Int32ComparisonDecidesEveryRecordAsTheEvaluatorDoes) {
    int bucket = hash(L"7", Index::BUCKETS);
    unsigned int other = 0;
    wchar_t text[16];
    for (unsigned int v = 8; v < 10000000u && other == 0; ++v)
        if (hash(wcs_itoa(v, text), Index::BUCKETS) == bucket) other = v;
    ASSERT_NE(0u, other);
    RecordSet rs = t->openRecordSet();
    add(rs, 7, L"a");
    add(rs, other, L"b");
    add(rs, 7, L"c");
    add(rs, 0, L"d");
    add(rs, 0xFFFFFFFFu, L"e");
    add(rs, 0x80000000u, L"f");
    rs.setFieldAsString(L"S", L"null");
    rs.get()->getRecord()->name(L"N")->setNull(true);
    ASSERT_TRUE(rs.insert());
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));

    Fields variables;
    ASSERT_TRUE(variables.add(L"id", FIELD_INT32));
    Int32Field* id = static_cast<Int32Field*>(variables.name(L"id"));
    CriteriaEvaluator walk(L"[N]==id");
    CriteriaEvaluator chain(L"[N]==id");
    ASSERT_TRUE(walk.setVariables(&variables));
    ASSERT_TRUE(chain.setVariables(&variables));
    auto names = [&](CriteriaEvaluator& e, bool byIndex, bool compared) {
        if (byIndex) {
            // As the cache names the column and the value of a lookup.
            ExpValue key;
            key.setNValueString(L"N");
            key.setNumericValue(id->value());
            EXPECT_TRUE(e.setHashInfo(key));
        }
        EXPECT_TRUE(rs.setCriteria(&e, false));
        EXPECT_EQ(byIndex, rs.get()->isIndexNavigation());
        if (compared) EXPECT_TRUE(rs.get()->compareInt32(0, id));
        std::wstring seen;
        for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) seen += std::wstring(rs.getFieldAsString(L"S")) + L",";
        return seen;
    };
    int found = 0;
    for (unsigned int v : {7u, other, 0u, 0xFFFFFFFFu, 0x80000000u, 12345u}) {
        for (bool nullVariable : {false, true}) {
            id->value(v);
            id->setNull(nullVariable);
            std::wstring byEvaluator = names(walk, false, false);
            EXPECT_EQ(byEvaluator, names(walk, false, true)) << v << (nullVariable ? " null" : "");
            if (!nullVariable) {
                std::wstring onChain = names(chain, true, false);
                EXPECT_EQ(onChain, names(chain, true, true)) << v;
                found += onChain.empty() ? 0 : 1;
            }
        }
    }
    EXPECT_EQ(5, found);
    id->setNull(false);
    id->value(7);
    EXPECT_EQ(L"c,a,", names(chain, true, true));  // the chain holds the newest first

    // Only an INT32 column against an INT32 variable, and only under criteria.
    ASSERT_TRUE(rs.setCriteria(&walk, false));
    EXPECT_FALSE(rs.get()->compareInt32(1, id));
    EXPECT_FALSE(rs.get()->compareInt32(2, id));
    EXPECT_FALSE(rs.get()->compareInt32(3, id));
    EXPECT_FALSE(rs.get()->compareInt32(0, nullptr));
    Fields texts;
    ASSERT_TRUE(texts.add(L"name", FIELD_TEXT));
    EXPECT_FALSE(rs.get()->compareInt32(0, texts.at(0)));
    ASSERT_TRUE(rs.setCriteria(nullptr, false));
    EXPECT_FALSE(rs.get()->compareInt32(0, id));
}
