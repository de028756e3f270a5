#include "fscanner/fscommon/table.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <memory>
#include <string>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

std::string word(uint32_t v) {
    std::string out(4, '\0');
    std::memcpy(&out[0], &v, 4);
    return out;
}

// A record of the test schema (N int32, S text) in a plain table: empty
// presence bits, N, a 2-byte length and the UTF-8 bytes.
std::string plainRecord(uint32_t n, const std::string& s) {
    std::string out(1, '\0');
    out += word(n);
    uint16_t length = static_cast<uint16_t>(s.size());
    out.append(reinterpret_cast<const char*>(&length), 2);
    return out + s;
}

// Header of the test schema with the given counts.
std::string plainHeader(uint32_t stored, uint32_t deleted) {
    return word(stored) + word(deleted) + word(2) + word(3) + word(4) + word('N') + word(5) + word(4) + word('S');
}

class CompactTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
    }
    void TearDown() override {
        FS_Table::compactCopyHook = nullptr;
        std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore);
    }

    std::unique_ptr<FS_Table> make() {
        std::unique_ptr<FS_Table> t(new FS_Table(L"tab", wdir.c_str(), false));
        t->addField(L"N", FIELD_INT32);
        t->addField(L"S", FIELD_TEXT);
        return t;
    }
    // A closed table of stored records 0..stored-1 with the first `removed` removed.
    std::unique_ptr<FS_Table> build(unsigned int stored, unsigned int removed, bool index = false) {
        auto t = make();
        EXPECT_TRUE(t->create());
        if (index) {
            EXPECT_TRUE(t->addHashIndex(L"byN", L"N"));
        }
        Fields rec(t->getFields());
        for (unsigned int i = 0; i < stored; ++i) {
            static_cast<Int32Field*>(rec.at(0))->value(i);
            std::wstring s = L"v" + std::to_wstring(i);
            static_cast<TextField*>(rec.at(1))->value(s.c_str());
            EXPECT_TRUE(t->insert(rec));
        }
        for (unsigned int i = 0; i < removed; ++i) EXPECT_TRUE(t->remove(i));
        EXPECT_TRUE(t->close());
        return t;
    }
    std::string file(const std::string& n) { return testsupport::readFile(dir.file(n)); }
    bool ran(FS_Table& t) {
        // A run leaves the deleted count at 0.
        EXPECT_TRUE(t.open());
        unsigned int deleted = 99;
        EXPECT_TRUE(t.count(1, &deleted));
        t.close();
        return deleted == 0;
    }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[sizeof LinuxSharedMutex::storePath];
};

TEST_F(CompactTest, ZeroPercentWithNoDeletedIsSkippedAndFilesUnchanged) {
    auto t = build(5, 0);
    std::string dat = file("tab.dat"), pxx = file("tab.pxx");
    testsupport::TraceCapture capture;
    EXPECT_TRUE(t->compact(0));
    EXPECT_TRUE(capture.contains("FS_Table::compact - [0] [stored: 5] [deleted: 0]")) << capture.dump();
    EXPECT_TRUE(capture.contains("FS_Table::compact - [tab] table compact skipped!")) << capture.dump();
    EXPECT_EQ(dat, file("tab.dat"));
    EXPECT_EQ(pxx, file("tab.pxx"));
    EXPECT_EQ(nullptr, t->getDataFile());
}

TEST_F(CompactTest, HundredPercentTenStoredTenDeletedIsSkipped) {
    // The stored count is the live count: 20 inserted, 10 removed.
    auto t = build(20, 10);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(t->compact(100));
    EXPECT_TRUE(capture.contains("FS_Table::compact - [100] [stored: 10] [deleted: 10]")) << capture.dump();
    EXPECT_TRUE(capture.contains("skipped!")) << capture.dump();
    EXPECT_FALSE(ran(*t));
}

TEST_F(CompactTest, HundredPercentTenStoredElevenDeletedRuns) {
    auto t = build(21, 11);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(t->compact(100));
    EXPECT_TRUE(capture.contains("FS_Table::compact - [100] [stored: 10] [deleted: 11]")) << capture.dump();
    EXPECT_TRUE(capture.contains("FS_Table::compact - performing [tab] table compact...")) << capture.dump();
    EXPECT_TRUE(ran(*t));
}

TEST_F(CompactTest, FiftyPercentTenStoredSixDeletedRunsFiveIsSkipped) {
    auto t = build(16, 6);
    EXPECT_TRUE(t->compact(50));
    EXPECT_TRUE(ran(*t));
    auto u = build(15, 5);
    EXPECT_TRUE(u->compact(50));
    EXPECT_FALSE(ran(*u));
}

TEST_F(CompactTest, NoStoredAndOneDeletedAlwaysRuns) {
    auto t = build(1, 1);
    EXPECT_TRUE(t->compact(1000));
    EXPECT_TRUE(ran(*t));
    EXPECT_EQ(0u, file("tab.pxx").size());
}

TEST_F(CompactTest, OpenTableRefusedAndUnchanged) {
    auto t = build(4, 3);
    std::string dat = file("tab.dat");
    ASSERT_TRUE(t->open());
    EXPECT_FALSE(t->compact(0));
    EXPECT_NE(nullptr, t->getDataFile());
    t->close();
    EXPECT_EQ(dat, file("tab.dat"));
}

TEST_F(CompactTest, TableThatWillNotOpenFails) {
    auto t = make();
    EXPECT_FALSE(t->compact(0));
}

TEST_F(CompactTest, RunKeepsStoredZeroesDeletedLeavesNoZeroSlotNorDeadBytes) {
    auto t = build(6, 3);
    std::string before = file("tab.dat");
    EXPECT_EQ(plainHeader(3, 3) + plainRecord(0, "v0") + plainRecord(1, "v1") + plainRecord(2, "v2") +
                  plainRecord(3, "v3") + plainRecord(4, "v4") + plainRecord(5, "v5"),
              before);
    EXPECT_TRUE(t->compact(10));
    // Byte for byte: the live records one after another behind the header,
    // no dead bytes and no padding; the pointer file has one slot per record.
    EXPECT_EQ(plainHeader(3, 0) + plainRecord(3, "v3") + plainRecord(4, "v4") + plainRecord(5, "v5"),
              file("tab.dat"));
    EXPECT_EQ(word(36) + word(45) + word(54), file("tab.pxx"));
    ASSERT_TRUE(t->open());
    unsigned int stored = 0, deleted = 9;
    ASSERT_TRUE(t->count(0, &stored));
    ASSERT_TRUE(t->count(1, &deleted));
    EXPECT_EQ(3u, stored);
    EXPECT_EQ(0u, deleted);
    Fields rec(t->getFields());
    std::string seen;
    unsigned int id = 0;
    for (bool ok = t->moveFirst(id); ok; ok = t->moveNext(id)) {
        ASSERT_TRUE(t->read(id, rec));
        seen += std::to_string(static_cast<Int32Field*>(rec.at(0))->value());
        seen += ":" + std::to_string(id) + " ";
    }
    EXPECT_EQ("3:0 4:1 5:2 ", seen);
    t->close();
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt.dat")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt.pxx")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt_idx.dat")));
}

TEST_F(CompactTest, ThresholdIsSigned32BitArithmeticThatWraps) {
    // 10 live records whose stored count is raised to 10000: 429497 * 10000
    // wraps to 2704, so the share is 27.
    auto t = build(38, 28);
    ASSERT_TRUE(t->open());
    ASSERT_TRUE(t->count(0, 9990));
    unsigned int stored = 0;
    ASSERT_TRUE(t->count(0, &stored));
    ASSERT_EQ(10000u, stored);
    t->close();
    testsupport::TraceCapture capture;
    EXPECT_TRUE(t->compact(429497));
    EXPECT_TRUE(capture.contains("FS_Table::compact - [429497] [stored: 10000] [deleted: 28]")) << capture.dump();
    EXPECT_TRUE(capture.contains("performing [tab] table compact")) << capture.dump();
    EXPECT_TRUE(ran(*t));

    auto u = build(37, 27);
    ASSERT_TRUE(u->open());
    ASSERT_TRUE(u->count(0, 9990));
    u->close();
    EXPECT_TRUE(u->compact(429497));
    EXPECT_FALSE(ran(*u));
}

TEST_F(CompactTest, NegativePercentRunsEvenWithNoDeletedRecords) {
    // -100 * 4 / 100 is -4, which is less than 0 deleted.
    auto t = build(4, 0);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(t->compact(-100));
    EXPECT_TRUE(capture.contains("performing [tab] table compact")) << capture.dump();
    EXPECT_EQ(plainHeader(4, 0) + plainRecord(0, "v0") + plainRecord(1, "v1") + plainRecord(2, "v2") +
                  plainRecord(3, "v3"),
              file("tab.dat"));
    t.reset();
    // With nothing stored the share is 0 whatever the percent, and 0 deleted
    // is not less than that.
    auto v = build(0, 0);
    testsupport::TraceCapture empty;
    EXPECT_TRUE(v->compact(-100));
    EXPECT_TRUE(empty.contains("FS_Table::compact - [tab] table compact skipped!")) << empty.dump();
    EXPECT_EQ(plainHeader(0, 0), file("tab.dat"));
}

TEST_F(CompactTest, TwoIndexesKeepTheirListOrderNamesAndFields) {
    auto t = make();
    ASSERT_TRUE(t->create());
    ASSERT_TRUE(t->addHashIndex(L"byS", L"S"));
    ASSERT_TRUE(t->addHashIndex(L"byN", L"N"));
    Fields rec(t->getFields());
    for (unsigned int i = 0; i < 8; ++i) {
        static_cast<Int32Field*>(rec.at(0))->value(i % 3);
        std::wstring s = L"w" + std::to_wstring(i);
        static_cast<TextField*>(rec.at(1))->value(s.c_str());
        ASSERT_TRUE(t->insert(rec));
    }
    for (unsigned int i = 0; i < 8; i += 2) ASSERT_TRUE(t->remove(i));
    ASSERT_TRUE(t->close());
    std::string list = file("tab_idx.dat");
    EXPECT_TRUE(t->compact(0));
    EXPECT_EQ(list, file("tab_idx.dat"));
    EXPECT_FALSE(testsupport::fileExists(dir.file("byS_cpt.idx")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("byN_cpt.idx")));
    // Rebuilt: only the live records' entries, with their new numbers.  Four
    // entries in four distinct text buckets, and N keys 1,0,2,1 in 3 buckets.
    EXPECT_EQ(65536u * 8u, file("byS.idx").size());
    EXPECT_EQ(65537u * 8u, file("byN.idx").size());
    ASSERT_TRUE(t->open());
    ASSERT_EQ(2u, t->getIndexes().size());
    EXPECT_STREQ(L"byS", t->getIndexes()[0]->getIndexName());
    EXPECT_STREQ(L"S", t->getIndexes()[0]->getFieldName());
    EXPECT_STREQ(L"byN", t->getIndexes()[1]->getIndexName());
    EXPECT_STREQ(L"N", t->getIndexes()[1]->getFieldName());
    RecordSet rs = t->openRecordSet();
    CriteriaEvaluator byS(L"[S]==\"W5\"");
    ASSERT_TRUE(rs.setCriteria(&byS, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(2u, rs.get()->getId());
    EXPECT_FALSE(rs.moveNext());
    CriteriaEvaluator byN(L"[N]==1");
    ASSERT_TRUE(rs.setCriteria(&byN, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    std::string seen;
    for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) seen += std::to_string(rs.get()->getId());
    EXPECT_EQ("30", seen);  // w7 then w1, newest first
    t->close();
}

TEST_F(CompactTest, IndexKeepsNameAndFieldAndFindsNewNumbers) {
    auto t = build(6, 4, true);
    EXPECT_TRUE(t->compact(0));
    EXPECT_TRUE(testsupport::fileExists(dir.file("byN.idx")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("byN_cpt.idx")));
    ASSERT_TRUE(t->open());
    ASSERT_EQ(1u, t->getIndexes().size());
    EXPECT_STREQ(L"byN", t->getIndexes()[0]->getIndexName());
    EXPECT_STREQ(L"N", t->getIndexes()[0]->getFieldName());
    unsigned int id = 99, next = 0;
    ASSERT_TRUE(t->hashIndex_moveFirst(*t->getIndexes()[0], L"5", id, next));
    EXPECT_EQ(1u, id);
    RecordSet rs = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==4");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_STREQ(L"v4", rs.getFieldAsString(L"S"));
    EXPECT_EQ(0u, rs.get()->getId());
    EXPECT_FALSE(rs.moveNext());
    CriteriaEvaluator gone(L"[N]==1");
    ASSERT_TRUE(rs.setCriteria(&gone, false));
    EXPECT_FALSE(rs.moveFirst());
    t->close();
}

TEST_F(CompactTest, FailedTemporaryIndexLeavesTableUsableAndNextRunReplacesLeftovers) {
    auto t = build(5, 3, true);
    std::string dat = file("tab.dat");
    // A directory where the temporary index file must go makes its creation fail.
    testsupport::TempDir keep;
    ASSERT_EQ(0, mkdir(dir.file("byN_cpt.idx").c_str(), 0700));
    EXPECT_FALSE(t->compact(0));
    EXPECT_EQ(nullptr, t->getDataFile());
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt_idx.dat")));
    EXPECT_EQ(dat, file("tab.dat"));
    ASSERT_TRUE(t->open());
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    EXPECT_EQ(3u, id);
    RecordSet rs = t->openRecordSet();
    CriteriaEvaluator e(L"[N]==4");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(4u, rs.get()->getId());
    t->close();
    // The leftovers of the failed run are replaced by the next one.
    EXPECT_TRUE(testsupport::fileExists(dir.file("tab_cpt.dat")));
    ASSERT_EQ(0, rmdir(dir.file("byN_cpt.idx").c_str()));
    EXPECT_TRUE(t->compact(0));
    EXPECT_TRUE(ran(*t));
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt.dat")));
    ASSERT_TRUE(t->open());
    RecordSet after = t->openRecordSet();
    CriteriaEvaluator again(L"[N]==4");
    ASSERT_TRUE(after.setCriteria(&again, false));
    ASSERT_TRUE(after.moveFirst());
    EXPECT_EQ(1u, after.get()->getId());
    t->close();
}

TEST_F(CompactTest, CompressedTableStaysCompressedAndReadable) {
    std::unique_ptr<FS_Table> t(new FS_Table(L"zip", wdir.c_str(), true));
    t->addField(L"N", FIELD_INT32);
    t->addField(L"S", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    for (unsigned int i = 0; i < 5; ++i) {
        static_cast<Int32Field*>(rec.at(0))->value(300000 + i);
        static_cast<TextField*>(rec.at(1))->value(L"z");
        ASSERT_TRUE(t->insert(rec));
    }
    ASSERT_TRUE(t->remove(0));
    ASSERT_TRUE(t->remove(3));
    ASSERT_TRUE(t->close());
    EXPECT_TRUE(t->compact(0));
    ASSERT_TRUE(t->open());
    std::string seen;
    unsigned int id = 0;
    for (bool ok = t->moveFirst(id); ok; ok = t->moveNext(id)) {
        ASSERT_TRUE(t->read(id, rec));
        seen += std::to_string(static_cast<Int32Field*>(rec.at(0))->value()) + " ";
    }
    EXPECT_EQ("300001 300002 300004 ", seen);
    EXPECT_EQ(12u, file("zip.pxx").size());
    t->close();
}

void dieAfterTwo(unsigned int copied) {
    if (copied == 2) kill(getpid(), SIGKILL);
}

TEST_F(CompactTest, ProcessKilledDuringCopyLeavesOriginalWhole) {
    auto t = build(6, 2, true);
    std::string dat = file("tab.dat"), pxx = file("tab.pxx"), idx = file("byN.idx");
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        FS_Table::compactCopyHook = dieAfterTwo;
        t->compact(0);
        _exit(0);
    }
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    ASSERT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(SIGKILL, WTERMSIG(status));
    EXPECT_TRUE(testsupport::fileExists(dir.file("tab_cpt.dat")));
    EXPECT_EQ(dat, file("tab.dat"));
    EXPECT_EQ(pxx, file("tab.pxx"));
    EXPECT_EQ(idx, file("byN.idx"));
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    std::string seen;
    unsigned int id = 0;
    for (bool ok = t->moveFirst(id); ok; ok = t->moveNext(id)) {
        ASSERT_TRUE(t->read(id, rec));
        seen += std::to_string(static_cast<Int32Field*>(rec.at(0))->value());
    }
    EXPECT_EQ("2345", seen);
    t->close();
    // The next run replaces the leftovers.
    EXPECT_TRUE(t->compact(0));
    EXPECT_TRUE(ran(*t));
    EXPECT_FALSE(testsupport::fileExists(dir.file("tab_cpt.dat")));
}

int copyPhasePipe = -1;

// Tells the parent that the copy phase is under way, then waits for the kill.
void reportAndWait(unsigned int copied) {
    if (copied != 50) return;
    char c = 'c';
    if (write(copyPhasePipe, &c, 1) != 1) _exit(3);
    for (;;) pause();
}

TEST_F(CompactTest, ChildKilledByParentDuringCopyLeavesOriginalOpeningAndReadingWhole) {
    auto t = build(120, 20, true);
    std::string dat = file("tab.dat"), pxx = file("tab.pxx"), idx = file("byN.idx"), list = file("tab_idx.dat");
    int fds[2];
    ASSERT_EQ(0, pipe(fds));
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        close(fds[0]);
        copyPhasePipe = fds[1];
        FS_Table::compactCopyHook = reportAndWait;
        t->compact(0);
        _exit(0);
    }
    close(fds[1]);
    char c = 0;
    ASSERT_EQ(1, read(fds[0], &c, 1));
    close(fds[0]);
    // The child has copied 50 records into the "_cpt" table and is still in
    // the copy phase.
    EXPECT_TRUE(testsupport::fileExists(dir.file("tab_cpt.dat")));
    EXPECT_TRUE(testsupport::fileExists(dir.file("byN_cpt.idx")));
    ASSERT_EQ(0, kill(child, SIGKILL));
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    ASSERT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(SIGKILL, WTERMSIG(status));
    EXPECT_TRUE(dat == file("tab.dat"));
    EXPECT_TRUE(pxx == file("tab.pxx"));
    EXPECT_TRUE(idx == file("byN.idx"));
    EXPECT_TRUE(list == file("tab_idx.dat"));

    ASSERT_TRUE(t->open());
    unsigned int stored = 0, deleted = 0;
    ASSERT_TRUE(t->count(0, &stored));
    ASSERT_TRUE(t->count(1, &deleted));
    EXPECT_EQ(100u, stored);
    EXPECT_EQ(20u, deleted);
    ASSERT_EQ(1u, t->getIndexes().size());
    RecordSet rs = t->openRecordSet();
    unsigned int expectedN = 20, walked = 0;
    for (bool ok = rs.moveFirst(); ok; ok = rs.moveNext()) {
        EXPECT_EQ(expectedN, rs.getFieldAsInt32(L"N"));
        EXPECT_EQ(expectedN, rs.get()->getId());
        std::wstring s = L"v" + std::to_wstring(expectedN);
        EXPECT_STREQ(s.c_str(), rs.getFieldAsString(L"S"));
        ++expectedN;
        ++walked;
    }
    EXPECT_EQ(100u, walked);
    CriteriaEvaluator e(L"[N]==77");
    ASSERT_TRUE(rs.setCriteria(&e, false));
    ASSERT_TRUE(rs.get()->isIndexNavigation());
    ASSERT_TRUE(rs.moveFirst());
    EXPECT_EQ(77u, rs.get()->getId());
    EXPECT_FALSE(rs.moveNext());
    t->close();
}

}  // namespace
