// The in-memory result set and its ownership rules.
#include <gtest/gtest.h>

#include "fscanner/fs/fs_resultset.h"

TEST(ResultSetOnVector, GetNextOnEmptySetReturnsZeroAndLeavesRecordUntouched) {
    FsResultSet_OnVector set;
    set.getWriter();
    FsResultSetReader* reader = set.getReader();
    FsFileInfo info;
    info.setFileName(L"keep");
    info.setFileSize(7);
    EXPECT_EQ(reader->getNext(info), 0);
    EXPECT_STREQ(info.getName(), L"keep");
    EXPECT_EQ(info.getSize(), 7ull);
    delete reader;
}

TEST(ResultSetOnVector, GetNextWithoutStorageReturnsZero) {
    FsResultSetReader_OnVector reader(nullptr);
    FsFileInfo info;
    reader.moveFirst();
    EXPECT_EQ(reader.getNext(info), 0);
    FsResultSetWriter_OnVector writer(nullptr);
    EXPECT_EQ(writer.addRecord(info), -1);
    EXPECT_EQ(writer.addRecord(L"/a", L"b", 1, 2, L"m", 3, 4), -1);
}

TEST(ResultSetOnVector, WriterAndReaderAreMadeOnce) {
    FsResultSet_OnVector set;
    FsResultSetWriter* writer = set.getWriter();
    EXPECT_EQ(set.getWriter(), writer);
    FsResultSetReader* reader = set.getReader();
    EXPECT_EQ(set.getReader(), reader);
    EXPECT_EQ(set.getWriter(), writer);
    delete reader;
}

namespace {

// A set built like the in-memory one but over a writer whose close is
// counted, to pin that getReader closes a writer exactly once.
class CloseCountingWriter : public FsResultSetWriter_OnVector {
public:
    explicit CloseCountingWriter(std::vector<FsFileInfo>* v, int* counter)
        : FsResultSetWriter_OnVector(v), closes(counter) {}
    int close() override {
        ++*closes;
        return FsResultSetWriter_OnVector::close();
    }

private:
    int* closes;
};

}  // namespace

TEST(ResultSetOnVector, WriterCloseIsHarmlessAndKeepsWriterUsable) {
    std::vector<FsFileInfo>* records = new std::vector<FsFileInfo>();
    int closes = 0;
    CloseCountingWriter writer(records, &closes);
    EXPECT_EQ(writer.close(), 0);
    EXPECT_EQ(closes, 1);
    EXPECT_EQ(writer.addRecord(L"/d", L"f", 1, 0x2000, L"0", 0, 0), 0);
    EXPECT_EQ(records->size(), 1u);
    FsResultSetReader_OnVector reader(records);  // takes the vector
}

TEST(ResultSetOnVector, TwoGetReaderCallsGiveTheSameReaderAndTheWriterStaysUsable) {
    // The in-memory writer's close has no visible effect; what is pinned here
    // is that the second call makes nothing new and the writer keeps working.
    FsResultSet_OnVector set;
    FsResultSetWriter* writer = set.getWriter();
    FsResultSetReader* first = set.getReader();
    FsResultSetReader* second = set.getReader();
    EXPECT_EQ(first, second);
    EXPECT_EQ(writer->addRecord(L"/d", L"f", 1, 0, L"0", 0, 0), 0);
    FsFileInfo info;
    EXPECT_EQ(first->getNext(info), 1);
    delete first;
}

TEST(ResultSetOnVector, RecordsSurviveTheSetWhileTheReaderLives) {
    FsResultSet_OnVector* set = new FsResultSet_OnVector();
    FsResultSetWriter* writer = set->getWriter();
    EXPECT_EQ(writer->addRecord(L"/dir", L"one", 10, 0x2000, L"abc", 1, 2), 0);
    EXPECT_EQ(writer->addRecord(L"/dir", L"two", 20, 0x2000, L"def", 3, 4), 0);
    FsResultSetReader* reader = set->getReader();
    delete set;
    FsFileInfo info;
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_STREQ(info.getName(), L"one");
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_STREQ(info.getName(), L"two");
    EXPECT_EQ(reader->getNext(info), 0);
    delete reader;
}

TEST(ResultSetOnVector, AddRecordAfterGetReaderIsStillDelivered) {
    FsResultSet_OnVector set;
    FsResultSetWriter* writer = set.getWriter();
    writer->addRecord(L"/a", L"first", 1, 0, L"0", 0, 0);
    FsResultSetReader* reader = set.getReader();
    FsFileInfo info;
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_EQ(reader->getNext(info), 0);
    EXPECT_EQ(writer->addRecord(L"/a", L"late", 2, 0, L"0", 0, 0), 0);
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_STREQ(info.getName(), L"late");
    delete reader;
}

TEST(ResultSetOnVector, SortAndBookmarksDoNothingAndKeepInsertionOrder) {
    FsResultSet_OnVector set;
    FsResultSetWriter* writer = set.getWriter();
    writer->addRecord(L"/z", L"c", 3, 0, L"0", 0, 0);
    writer->addRecord(L"/y", L"a", 1, 0, L"0", 0, 0);
    writer->addRecord(L"/x", L"b", 2, 0, L"0", 0, 0);
    FsResultSetReader* reader = set.getReader();
    for (unsigned int key = 1; key <= 4; ++key) {
        EXPECT_EQ(reader->sort(key, 1, true), 0);
        EXPECT_EQ(reader->sort(key, 2, false), 0);
    }
    EXPECT_EQ(reader->setBookmark(), 0);
    EXPECT_EQ(reader->toBookmark(), 0);
    reader->moveFirst();
    FsFileInfo info;
    const wchar_t* expected[] = {L"c", L"a", L"b"};
    for (const wchar_t* name : expected) {
        ASSERT_EQ(reader->getNext(info), 1);
        EXPECT_STREQ(info.getName(), name);
    }
    delete reader;
}

TEST(ResultSetOnVector, SevenFieldAddRecordSetsFourPresenceBits) {
    FsResultSet_OnVector set;
    FsResultSetWriter* writer = set.getWriter();
    ASSERT_EQ(writer->addRecord(L"/p", L"n", 123, 0x2000, L"d41d8", 0x11, 0x22), 0);
    FsResultSetReader* reader = set.getReader();
    FsFileInfo info;
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_EQ(info.getValidMask(), 0x1u | 0x2u | 0x400u | 0x800u);
    EXPECT_STREQ(info.getPath(), L"/p");
    EXPECT_STREQ(info.getName(), L"n");
    EXPECT_EQ(info.getSize(), 123ull);
    EXPECT_EQ(info.getAttr(), 0x2000u);
    EXPECT_STREQ(info.getMD5(), L"d41d8");
    EXPECT_EQ(info.getCRC32(), 0x11u);
    EXPECT_EQ(info.getQ32(), 0x22u);
    EXPECT_STREQ(info.getSHA256(), L"0");
    delete reader;
}

TEST(ResultSetOnVector, RecordFormKeepsEveryField) {
    FsResultSet_OnVector set;
    FsFileInfo original;
    original.setFilePath(L"/p");
    original.setFileName(L"n");
    original.setLastModifyTime(42);
    original.setSHA256(L"ff");
    ASSERT_EQ(set.getWriter()->addRecord(original), 0);
    original.setFileName(L"changed");
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    FsFileInfo info;
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_STREQ(info.getName(), L"n");
    EXPECT_EQ(info.getValidMask(), 0x100u);
    EXPECT_EQ(info.getLastModifyTime(), 42);
    EXPECT_STREQ(info.getSHA256(), L"ff");
    delete reader;
}

TEST(ResultSetOnVector, ReaderStartsAtFirstRecordWithoutMoveFirstAndRewinds) {
    FsResultSet_OnVector set;
    set.getWriter()->addRecord(L"/a", L"x", 1, 0, L"0", 0, 0);
    FsResultSetReader* reader = set.getReader();
    FsFileInfo info;
    ASSERT_EQ(reader->getNext(info), 1);
    EXPECT_EQ(reader->getNext(info), 0);
    reader->moveFirst();
    EXPECT_EQ(reader->getNext(info), 1);
    delete reader;
}
