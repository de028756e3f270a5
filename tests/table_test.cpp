#include "fscanner/fscommon/table.h"

#include <gtest/gtest.h>

#include <clocale>
#include <cstring>
#include <memory>
#include <string>
#include <vector>

#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

std::string bytes(std::initializer_list<int> list) {
    std::string out;
    for (int b : list) out.push_back(static_cast<char>(b));
    return out;
}

std::string hex(const std::string& s) {
    static const char* digits = "0123456789ABCDEF";
    std::string out;
    for (unsigned char c : s) {
        out += digits[c >> 4];
        out += digits[c & 15];
        out += ' ';
    }
    return out;
}

class TableTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
    }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore); }

    std::unique_ptr<FS_Table> table(const wchar_t* name, bool compressed = false) {
        return std::unique_ptr<FS_Table>(new FS_Table(name, wdir.c_str(), compressed));
    }
    // Columns a:Int8 b:Int32 c:Text d:Int16 e:Int64.
    std::unique_ptr<FS_Table> fiveColumns(const wchar_t* name, bool compressed) {
        auto t = table(name, compressed);
        t->addField(L"a", FIELD_INT8);
        t->addField(L"b", FIELD_INT32);
        t->addField(L"c", FIELD_TEXT);
        t->addField(L"d", FIELD_INT16);
        t->addField(L"e", FIELD_INT64);
        return t;
    }
    std::string file(const std::string& name) { return testsupport::readFile(dir.file(name)); }

    static void setInt32(Fields& f, unsigned int i, unsigned int v) { static_cast<Int32Field*>(f.at(i))->value(v); }
    static unsigned int getInt32(Fields& f, unsigned int i) { return static_cast<Int32Field*>(f.at(i))->value(); }
    static void setText(Fields& f, unsigned int i, const wchar_t* v) { static_cast<TextField*>(f.at(i))->value(v); }
    static std::wstring getText(Fields& f, unsigned int i) {
        const wchar_t* v = static_cast<TextField*>(f.at(i))->value();
        return v == nullptr ? L"<null>" : v;
    }
    // Table of one Int32 column "n" holding 0..count-1.
    std::unique_ptr<FS_Table> numbers(const wchar_t* name, unsigned int count) {
        auto t = table(name);
        t->addField(L"n", FIELD_INT32);
        EXPECT_TRUE(t->create());
        Fields rec(t->getFields());
        for (unsigned int i = 0; i < count; ++i) {
            setInt32(rec, 0, i);
            EXPECT_TRUE(t->insert(rec));
        }
        return t;
    }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[1024];
};

const std::string kFiveColumnHeaderDescriptors = bytes({
    0x05, 0, 0, 0,                                      // field count
    0x01, 0, 0, 0, 0x04, 0, 0, 0, 'a', 0, 0, 0,         // a: Int8
    0x03, 0, 0, 0, 0x04, 0, 0, 0, 'b', 0, 0, 0,         // b: Int32
    0x05, 0, 0, 0, 0x04, 0, 0, 0, 'c', 0, 0, 0,         // c: Text
    0x02, 0, 0, 0, 0x04, 0, 0, 0, 'd', 0, 0, 0,         // d: Int16
    0x04, 0, 0, 0, 0x04, 0, 0, 0, 'e', 0, 0, 0,         // e: Int64
});

void fillFirstRecord(Fields& rec) {
    static_cast<Int8Field*>(rec.at(0))->value(7);
    static_cast<Int32Field*>(rec.at(1))->value(0x01020304u);
    static_cast<TextField*>(rec.at(2))->value(L"h\u00e9");
    static_cast<Int16Field*>(rec.at(3))->value(0x1234);
    static_cast<Int64Field*>(rec.at(4))->value(0x0102030405060708ull);
}

// ---- byte layout ----------------------------------------------------------------

TEST_F(TableTest, PlainTableFilesHoldHeaderDescriptorsBitmapAndValuesByteForByte) {
    auto t = fiveColumns(L"plain", false);
    ASSERT_TRUE(t->create());
    EXPECT_EQ(72u, t->headerSize());
    EXPECT_EQ(1u, t->getBitmapSize());
    Fields rec(t->getFields());
    fillFirstRecord(rec);
    ASSERT_TRUE(t->insert(rec));
    Fields empty(t->getFields());  // every null flag set, values zero
    ASSERT_TRUE(t->insert(empty));
    ASSERT_TRUE(t->close());

    std::string expected = bytes({0x02, 0, 0, 0, 0, 0, 0, 0}) + kFiveColumnHeaderDescriptors +
                           bytes({
                               0x00,                                            // presence bits
                               0x07,                                            // a
                               0x04, 0x03, 0x02, 0x01,                          // b
                               0x03, 0x00, 'h', 0xC3, 0xA9,                     // c: length 3, UTF-8
                               0x34, 0x12,                                      // d
                               0x08, 0x07, 0x06, 0x05, 0x04, 0x03, 0x02, 0x01,  // e
                               0xF8,                                            // five bits set
                               0x00, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0,
                           });
    EXPECT_EQ(hex(expected), hex(file("plain.dat")));
    EXPECT_EQ(hex(bytes({0x48, 0, 0, 0, 0x5D, 0, 0, 0})), hex(file("plain.pxx")));
}

TEST_F(TableTest, CompressedTableFilesUseSevenBitGroupsByteForByte) {
    auto t = fiveColumns(L"packed", true);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    fillFirstRecord(rec);
    ASSERT_TRUE(t->insert(rec));
    Fields empty(t->getFields());
    ASSERT_TRUE(t->insert(empty));
    ASSERT_TRUE(t->close());

    std::string expected = bytes({0x02, 0, 0, 0, 0, 0, 0, 0}) + kFiveColumnHeaderDescriptors +
                           bytes({
                               0x00,                                                  // presence bits
                               0x07,                                                  // a: one byte always
                               0x11, 0x11, 0x0D, 0x08,                                // b
                               0x06, 'h', 0xC3, 0xA9,                                 // c: length 3 as 0x06
                               0x49, 0x68,                                            // d
                               0x03, 0x03, 0x01, 0xC1, 0x81, 0x51, 0x31, 0x1D, 0x10,  // e
                               0xF8, 0x00, 0x00, 0x00, 0x00, 0x00,
                           });
    EXPECT_EQ(hex(expected), hex(file("packed.dat")));
    EXPECT_EQ(hex(bytes({0x48, 0, 0, 0, 0x5D, 0, 0, 0})), hex(file("packed.pxx")));
}

TEST_F(TableTest, ReopenedTablesReadTheirRecordsBack) {
    for (bool compressed : {false, true}) {
        const wchar_t* name = compressed ? L"rc" : L"rp";
        {
            auto t = fiveColumns(name, compressed);
            ASSERT_TRUE(t->create());
            Fields rec(t->getFields());
            fillFirstRecord(rec);
            ASSERT_TRUE(t->insert(rec));
        }
        auto t = table(name, compressed);
        ASSERT_TRUE(t->open());
        ASSERT_EQ(5u, t->getFields().count());
        EXPECT_STREQ(L"c", t->getFields().at(2)->getName());
        EXPECT_EQ(FIELD_TEXT, t->getFields().at(2)->getType());
        Fields rec(t->getFields());
        ASSERT_TRUE(t->read(0, rec));
        EXPECT_EQ(7, static_cast<Int8Field*>(rec.at(0))->value());
        EXPECT_EQ(0x01020304u, getInt32(rec, 1));
        EXPECT_EQ(std::wstring(L"h\u00e9"), getText(rec, 2));
        EXPECT_EQ(0x1234, static_cast<Int16Field*>(rec.at(3))->value());
        EXPECT_EQ(0x0102030405060708ull, static_cast<Int64Field*>(rec.at(4))->value());
        unsigned int stored = 0;
        ASSERT_TRUE(t->count(0, &stored));
        EXPECT_EQ(1u, stored);
    }
}

// ---- compressed integers --------------------------------------------------------

TEST(CompressIntTest, ZeroInASixteenByteBufferReturns15AndLeavesByte15AtZero) {
    char buf[16];
    std::memset(buf, 0x55, sizeof buf);
    EXPECT_EQ(15, compressInt(0, buf, 16));
    EXPECT_EQ(0, buf[15]);
    EXPECT_EQ(0u, decompressInt(buf + 15));
}

TEST(CompressIntTest, KnownEncodingsAndRoundTrips) {
    struct Case {
        unsigned long long value;
        std::string encoded;
    } cases[] = {
        {1, bytes({0x02})},
        {127, bytes({0xFE})},
        {128, bytes({0x03, 0x00})},
        {300, bytes({0x05, 0x58})},
        {0xFFFFFFFFFFFFFFFFull, bytes({0x03, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFE})},
    };
    for (const Case& c : cases) {
        char buf[16];
        int first = compressInt(c.value, buf, 16);
        EXPECT_EQ(hex(c.encoded), hex(std::string(buf + first, 16 - first))) << c.value;
        EXPECT_EQ(c.value, decompressInt(buf + first));
    }
}

// ---- records --------------------------------------------------------------------

TEST_F(TableTest, TableWithNoFieldsWritesAnEmptyBitmapAndStillTakesANumber) {
    auto t = table(L"nofields");
    ASSERT_TRUE(t->create());
    EXPECT_EQ(0u, t->getBitmapSize());
    Fields none;
    ASSERT_TRUE(t->insert(none));
    ASSERT_TRUE(t->insert(none));
    unsigned int id = 99;
    ASSERT_TRUE(t->moveFirst(id));
    EXPECT_EQ(0u, id);
    ASSERT_TRUE(t->moveNext(id));
    EXPECT_EQ(1u, id);
    EXPECT_TRUE(t->read(1, none));
    ASSERT_TRUE(t->close());
    EXPECT_EQ(hex(bytes({0x02, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0})), hex(file("nofields.dat")));
    EXPECT_EQ(hex(bytes({0x0C, 0, 0, 0, 0x0C, 0, 0, 0})), hex(file("nofields.pxx")));
}

TEST_F(TableTest, NineFieldsGiveATwoByteBitmapWithField8AtTheTopOfByteTwo) {
    auto t = table(L"nine");
    const wchar_t* names[] = {L"f0", L"f1", L"f2", L"f3", L"f4", L"f5", L"f6", L"f7", L"f8"};
    for (const wchar_t* n : names) ASSERT_TRUE(t->addField(n, FIELD_INT8));
    ASSERT_TRUE(t->create());
    EXPECT_EQ(2u, t->getBitmapSize());
    Fields rec(t->getFields());
    for (unsigned int i = 0; i < 8; ++i) static_cast<Int8Field*>(rec.at(i))->value(static_cast<unsigned char>(i));
    ASSERT_TRUE(t->insert(rec));  // only field 8 is still null
    Fields rec2(t->getFields());
    static_cast<Int8Field*>(rec2.at(8))->value(8);
    ASSERT_TRUE(t->insert(rec2));  // fields 0..7 null
    unsigned int header = t->headerSize();
    ASSERT_TRUE(t->close());
    std::string dat = file("nine.dat");
    ASSERT_EQ(header + 11 + 11, dat.size());
    EXPECT_EQ(hex(bytes({0x00, 0x80, 0, 1, 2, 3, 4, 5, 6, 7, 0})), hex(dat.substr(header, 11)));
    EXPECT_EQ(hex(bytes({0xFF, 0x00, 0, 0, 0, 0, 0, 0, 0, 0, 8})), hex(dat.substr(header + 11, 11)));
}

TEST_F(TableTest, BitsAreNumberedFromTheMostSignificantEnd) {
    unsigned char buf[32];
    std::memset(buf, 0, sizeof buf);
    FS_Table::setBit(0, buf);
    FS_Table::setBit(7, buf);
    FS_Table::setBit(8, buf);
    FS_Table::setBit(255, buf);
    EXPECT_EQ(0x81, buf[0]);
    EXPECT_EQ(0x80, buf[1]);
    EXPECT_EQ(0x01, buf[31]);
    EXPECT_TRUE(FS_Table::checkBit(7, buf));
    EXPECT_FALSE(FS_Table::checkBit(6, buf));
}

TEST_F(TableTest, AfterReadEveryFieldReportsNotNull) {
    auto t = fiveColumns(L"nulls", false);
    ASSERT_TRUE(t->create());
    Fields allNull(t->getFields());
    ASSERT_TRUE(t->insert(allNull));
    Fields rec(t->getFields());
    ASSERT_TRUE(t->read(0, rec));
    for (unsigned int i = 0; i < rec.count(); ++i) EXPECT_FALSE(rec.at(i)->isNull()) << i;
    EXPECT_EQ(std::wstring(L""), getText(rec, 2));
}

TEST_F(TableTest, ReadOnClosedTableLeavesFieldsAndReturnsTrue) {
    auto t = table(L"closed");
    t->addField(L"n", FIELD_INT32);
    Fields rec(t->getFields());
    setInt32(rec, 0, 1234);
    EXPECT_TRUE(t->read(0, rec));
    EXPECT_EQ(1234u, getInt32(rec, 0));
    ASSERT_TRUE(t->create());
    ASSERT_TRUE(t->close());
    EXPECT_TRUE(t->read(5, rec));
    EXPECT_EQ(1234u, getInt32(rec, 0));
    EXPECT_FALSE(rec.at(0)->isNull());
}

TEST_F(TableTest, ColumnOfTypeSixMakesReadFailThereWithEarlierColumnsFilled) {
    auto t = table(L"hex");
    t->addField(L"n", FIELD_INT32);
    t->addField(L"h", FIELD_HEX);
    t->addField(L"m", FIELD_INT32);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    setInt32(rec, 0, 11);
    const unsigned char hb[] = {2, 0xAB, 0xCD};
    static_cast<HexField*>(rec.at(1))->value(hb);
    setInt32(rec, 2, 22);
    ASSERT_TRUE(t->insert(rec));
    unsigned int header = t->headerSize();
    Fields out(t->getFields());
    EXPECT_FALSE(t->read(0, out));
    EXPECT_EQ(11u, getInt32(out, 0));
    EXPECT_EQ(0u, getInt32(out, 2));
    ASSERT_TRUE(t->close());
    // The hex value is not stored: bitmap, 4 bytes, 4 bytes.
    EXPECT_EQ(hex(bytes({0x00, 11, 0, 0, 0, 22, 0, 0, 0})), hex(file("hex.dat").substr(header)));
}

TEST_F(TableTest, LongTextsGoThroughTheHeapAndAreCutAtTheirLengthModulo65536) {
    auto t = table(L"long");
    t->addField(L"s", FIELD_TEXT);
    t->addField(L"n", FIELD_INT32);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    std::wstring s300(300, L'x');
    setText(rec, 0, s300.c_str());
    setInt32(rec, 1, 5);
    ASSERT_TRUE(t->insert(rec));
    std::wstring s70000(70000, L'y');
    setText(rec, 0, s70000.c_str());
    ASSERT_TRUE(t->insert(rec));
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(0, out));
    EXPECT_EQ(s300, getText(out, 0));
    EXPECT_EQ(5u, getInt32(out, 1));
    ASSERT_TRUE(t->read(1, out));
    EXPECT_EQ(std::wstring(70000 % 65536, L'y'), getText(out, 0));
    EXPECT_EQ(5u, getInt32(out, 1));
}

TEST_F(TableTest, WideCharactersRoundTripThroughUtf8) {
    auto t = table(L"utf", true);
    t->addField(L"s", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    std::wstring text = L"\u00e9\u4e2d\U0001F600z";
    setText(rec, 0, text.c_str());
    ASSERT_TRUE(t->insert(rec));
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(0, out));
    EXPECT_EQ(text, getText(out, 0));
}

TEST_F(TableTest, InsertAndRemoveOnAClosedTableFail) {
    auto t = table(L"shut");
    t->addField(L"n", FIELD_INT32);
    Fields rec(t->getFields());
    EXPECT_FALSE(t->insert(rec));
    EXPECT_FALSE(t->remove(0));
    EXPECT_FALSE(t->update(0, rec));
    unsigned int id = 0, index = 0, c = 0;
    EXPECT_FALSE(t->moveFirst(id));
    EXPECT_FALSE(t->moveNext(id));
    EXPECT_FALSE(t->movePrevious(id));
    EXPECT_FALSE(t->moveLast(id, index));
    EXPECT_FALSE(t->eof());
    EXPECT_FALSE(t->count(0, &c));
    EXPECT_FALSE(t->incCount(0));
}

// ---- walks ------------------------------------------------------------------------

TEST_F(TableTest, MoveFirstSkipsARemovedSlotZero) {
    auto t = numbers(L"mf", 4);
    ASSERT_TRUE(t->remove(0));
    ASSERT_TRUE(t->remove(1));
    unsigned int id = 77;
    ASSERT_TRUE(t->moveFirst(id));
    EXPECT_EQ(2u, id);
    Fields rec(t->getFields());
    ASSERT_TRUE(t->read(id, rec));
    EXPECT_EQ(2u, getInt32(rec, 0));
}

TEST_F(TableTest, AfterRemovingEveryRecordMoveFirstFailsAndCountsFollow) {
    auto t = numbers(L"all", 3);
    for (unsigned int i = 0; i < 3; ++i) ASSERT_TRUE(t->remove(i));
    unsigned int id = 0;
    EXPECT_FALSE(t->moveFirst(id));
    unsigned int stored = 9, deleted = 9;
    ASSERT_TRUE(t->count(0, &stored));
    ASSERT_TRUE(t->count(1, &deleted));
    EXPECT_EQ(0u, stored);
    EXPECT_EQ(3u, deleted);
    unsigned int index = 55;
    id = 44;
    EXPECT_FALSE(t->moveLast(id, index));
    EXPECT_EQ(44u, id);
    EXPECT_EQ(55u, index);
}

TEST_F(TableTest, MoveNextWalksLiveNumbersAndLeavesIdAloneAtTheEnd) {
    auto t = numbers(L"mn", 5);
    ASSERT_TRUE(t->remove(1));
    ASSERT_TRUE(t->remove(3));
    std::vector<unsigned int> seen;
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    seen.push_back(id);
    while (t->moveNext(id)) seen.push_back(id);
    EXPECT_EQ((std::vector<unsigned int>{0, 2, 4}), seen);
    EXPECT_EQ(4u, id);
    id = 100;
    EXPECT_FALSE(t->moveNext(id));
    EXPECT_EQ(100u, id);
}

TEST_F(TableTest, MoveLastSetsIdAndIndexButReturnsZero) {
    auto t = numbers(L"ml", 4);
    ASSERT_TRUE(t->remove(3));
    unsigned int id = 0, index = 0;
    EXPECT_FALSE(t->moveLast(id, index));
    EXPECT_EQ(2u, id);
    EXPECT_EQ(2u, index);
    auto one = numbers(L"ml1", 1);
    id = 9;
    index = 9;
    EXPECT_FALSE(one->moveLast(id, index));
    EXPECT_EQ(0u, id);
    EXPECT_EQ(0u, index);
}

TEST_F(TableTest, MovePreviousOnLiveSlotsStepsBack) {
    auto t = numbers(L"mp", 3);
    unsigned int id = 2;
    ASSERT_TRUE(t->movePrevious(id));
    EXPECT_EQ(1u, id);
    ASSERT_TRUE(t->movePrevious(id));
    EXPECT_EQ(0u, id);
    EXPECT_FALSE(t->movePrevious(id));
    EXPECT_EQ(0u, id);
}

TEST_F(TableTest, MovePreviousOverARemovedSlotCountsDownWhileReadingForward) {
    auto t = numbers(L"mpq", 4);
    ASSERT_TRUE(t->remove(2));
    // From 3: slot 2 is removed, so the number drops to 1 while the next read
    // is slot 3, which is live: the walk reports 1.
    unsigned int id = 3;
    ASSERT_TRUE(t->movePrevious(id));
    EXPECT_EQ(1u, id);

    auto u = numbers(L"mpr", 3);
    ASSERT_TRUE(u->remove(1));
    ASSERT_TRUE(u->remove(2));
    // From 2: slot 1 removed, slot 2 removed, then the end of the file.
    id = 2;
    EXPECT_FALSE(u->movePrevious(id));
    EXPECT_EQ(2u, id);
}

TEST_F(TableTest, EofIsTrueAtTheEndOfTheDataFileAndKeepsThePosition) {
    auto t = numbers(L"eof", 2);
    EXPECT_FALSE(t->eof());  // the count update after insert left the position in the header
    Fields rec(t->getFields());
    ASSERT_TRUE(t->read(1, rec));
    EXPECT_TRUE(t->eof());
    ASSERT_TRUE(t->read(0, rec));
    EXPECT_FALSE(t->eof());
    EXPECT_FALSE(t->eof());
}

// ---- update and remove --------------------------------------------------------------

TEST_F(TableTest, UpdateWithTheSameCharacterCountKeepsTheNumber) {
    auto t = table(L"upd");
    t->addField(L"n", FIELD_INT32);
    t->addField(L"s", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    setInt32(rec, 0, 1);
    setText(rec, 1, L"abc");
    ASSERT_TRUE(t->insert(rec));
    ASSERT_TRUE(t->insert(rec));
    setInt32(rec, 0, 2);
    setText(rec, 1, L"xyz");
    ASSERT_TRUE(t->update(0, rec));
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(0, out));
    EXPECT_EQ(2u, getInt32(out, 0));
    EXPECT_EQ(std::wstring(L"xyz"), getText(out, 1));
    unsigned int stored = 0, deleted = 0;
    t->count(0, &stored);
    t->count(1, &deleted);
    EXPECT_EQ(2u, stored);
    EXPECT_EQ(0u, deleted);
    unsigned int id = 0, index = 0;
    t->moveLast(id, index);
    EXPECT_EQ(1u, id);
}

TEST_F(TableTest, UpdateWithAnotherCharacterCountMovesTheRecordToANewNumber) {
    auto t = table(L"mv");
    t->addField(L"n", FIELD_INT32);
    t->addField(L"s", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    setInt32(rec, 0, 1);
    setText(rec, 1, L"abc");
    ASSERT_TRUE(t->insert(rec));
    ASSERT_TRUE(t->insert(rec));
    setInt32(rec, 0, 3);
    setText(rec, 1, L"longer text");
    ASSERT_TRUE(t->update(0, rec));
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    EXPECT_EQ(1u, id);  // slot 0 now reads 0
    unsigned int last = 0, index = 0;
    t->moveLast(last, index);
    EXPECT_EQ(2u, last);
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(2, out));
    EXPECT_EQ(3u, getInt32(out, 0));
    EXPECT_EQ(std::wstring(L"longer text"), getText(out, 1));
    unsigned int stored = 0, deleted = 0;
    t->count(0, &stored);
    t->count(1, &deleted);
    EXPECT_EQ(2u, stored);
    EXPECT_EQ(1u, deleted);
    ASSERT_TRUE(t->close());
    std::string pxx = file("mv.pxx");
    ASSERT_EQ(12u, pxx.size());
    EXPECT_EQ(hex(bytes({0, 0, 0, 0})), hex(pxx.substr(0, 4)));
}

TEST_F(TableTest, UpdateOfEqualCharacterCountButOtherUtf8LengthOverwritesInPlace) {
    auto t = table(L"inplace");
    t->addField(L"n", FIELD_INT32);
    t->addField(L"s", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    setInt32(rec, 0, 1);
    setText(rec, 1, L"h\u00e9");  // 2 characters, 3 bytes
    ASSERT_TRUE(t->insert(rec));
    unsigned int header = t->headerSize();
    setText(rec, 1, L"ab");  // 2 characters, 2 bytes
    ASSERT_TRUE(t->update(0, rec));
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(0, out));
    EXPECT_EQ(std::wstring(L"ab"), getText(out, 1));
    ASSERT_TRUE(t->close());
    // The third old byte stays behind the new text.
    EXPECT_EQ(hex(bytes({0x00, 1, 0, 0, 0, 0x02, 0x00, 'a', 'b', 0xA9})), hex(file("inplace.dat").substr(header)));
}

TEST_F(TableTest, UpdateInACompressedTableAlwaysMoves) {
    auto t = table(L"cmv", true);
    t->addField(L"n", FIELD_INT32);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    setInt32(rec, 0, 1);
    ASSERT_TRUE(t->insert(rec));
    setInt32(rec, 0, 2);
    ASSERT_TRUE(t->update(0, rec));
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    EXPECT_EQ(1u, id);
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(1, out));
    EXPECT_EQ(2u, getInt32(out, 0));
}

TEST_F(TableTest, RemovingASlotTwiceLetsTheCountsDrift) {
    auto t = numbers(L"twice", 2);
    ASSERT_TRUE(t->remove(0));
    ASSERT_TRUE(t->remove(0));
    unsigned int stored = 0, deleted = 0;
    t->count(0, &stored);
    t->count(1, &deleted);
    EXPECT_EQ(0u, stored);
    EXPECT_EQ(2u, deleted);
    ASSERT_TRUE(t->remove(1));
    t->count(0, &stored);
    EXPECT_EQ(0xFFFFFFFFu, stored);  // the unsigned word wraps without a check
}

TEST_F(TableTest, RemoveOfANumberPastTheEndFailsAndLeavesThePointerFile) {
    auto t = numbers(L"past", 2);
    EXPECT_FALSE(t->remove(2));
    EXPECT_FALSE(t->remove(0xFFFFFFFFu));
    ASSERT_TRUE(t->close());
    EXPECT_EQ(8u, file("past.pxx").size());
}

TEST_F(TableTest, ReadOfARemovedSlotReadsTheHeaderAsARecord) {
    auto t = numbers(L"hdr", 2);
    ASSERT_TRUE(t->remove(0));
    Fields rec(t->getFields());
    ASSERT_TRUE(t->read(0, rec));
    // Offset 0: one bitmap byte (stored count 1), then the next 4 bytes of the
    // header as the value: 00 00 00 | 01 (deleted count's first byte).
    EXPECT_EQ(0x01000000u, getInt32(rec, 0));
}

// ---- counts, lifecycle ----------------------------------------------------------------

TEST_F(TableTest, CountsRefuseAnotherWhich) {
    auto t = numbers(L"which", 1);
    unsigned int c = 0;
    EXPECT_FALSE(t->count(2, &c));
    EXPECT_FALSE(t->count(-1, &c));
    EXPECT_FALSE(t->incCount(2));
    EXPECT_FALSE(t->decCount(3));
    EXPECT_TRUE(t->incCount(1));
    ASSERT_TRUE(t->count(1, &c));
    EXPECT_EQ(1u, c);
    EXPECT_TRUE(t->decCount(1));
    ASSERT_TRUE(t->count(1, &c));
    EXPECT_EQ(0u, c);
}

TEST_F(TableTest, AddFieldIsRefusedWhileOpenAndCloseEmptiesTheSchema) {
    auto t = table(L"schema");
    ASSERT_TRUE(t->addField(L"n", FIELD_INT32));
    EXPECT_FALSE(t->addField(L"bad", 9));
    ASSERT_TRUE(t->create());
    EXPECT_FALSE(t->addField(L"late", FIELD_INT32));
    EXPECT_EQ(1u, t->getFields().count());
    EXPECT_TRUE(t->close());
    EXPECT_EQ(0u, t->getFields().count());
    EXPECT_TRUE(t->close());  // always safe
    EXPECT_TRUE(t->addField(L"again", FIELD_INT8));
}

TEST_F(TableTest, OpenOfAMissingTableFailsAndCreateReplacesAnExistingOne) {
    auto t = table(L"fresh");
    t->addField(L"n", FIELD_INT32);
    EXPECT_FALSE(t->open());
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    ASSERT_TRUE(t->insert(rec));
    ASSERT_TRUE(t->close());
    EXPECT_EQ(8u, file("fresh.pxx").size() * 2);
    t->addField(L"n", FIELD_INT32);
    ASSERT_TRUE(t->create());
    ASSERT_TRUE(t->close());
    EXPECT_EQ(0u, file("fresh.pxx").size());
    EXPECT_EQ(24u, file("fresh.dat").size());
}

TEST_F(TableTest, CreateRemovesTheIndexListButNotIndexFiles) {
    dir.write("lst_idx.dat", "stale list");
    dir.write("old.idx", "stale index");
    auto t = table(L"lst");
    t->addField(L"n", FIELD_INT32);
    ASSERT_TRUE(t->create());
    EXPECT_FALSE(testsupport::fileExists(dir.file("lst_idx.dat")));
    EXPECT_TRUE(testsupport::fileExists(dir.file("old.idx")));
}

TEST_F(TableTest, EraseNeedsAClosedTableAndRemovesItsFiles) {
    auto t = numbers(L"gone", 2);
    EXPECT_FALSE(t->erase());
    ASSERT_TRUE(t->close());
    EXPECT_TRUE(testsupport::fileExists(dir.file("gone.dat")));
    EXPECT_TRUE(t->erase());
    EXPECT_FALSE(testsupport::fileExists(dir.file("gone.dat")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("gone.pxx")));
    EXPECT_FALSE(t->open());
}

TEST_F(TableTest, FileNamesComeFromNameAndDirectory) {
    FS_Table t(L"names", wide(dir.path()).c_str(), false);  // no final "/" given
    EXPECT_EQ(wide(dir.path() + "/"), std::wstring(t.getDirectory()));
    EXPECT_EQ(wide(dir.path() + "/names.dat"), std::wstring(t.getDataPath()));
    EXPECT_EQ(wide(dir.path() + "/names.pxx"), std::wstring(t.getPointerPath()));
    EXPECT_EQ(std::wstring(L"names_idx.dat"), std::wstring(t.getIndexListName()));
    EXPECT_TRUE(testsupport::fileExists(locks.file("names_t_mutex")));
}

TEST_F(TableTest, TableWithoutDirectoryIsUnusable) {
    FS_Table t(L"nodir", nullptr, false);
    EXPECT_EQ(nullptr, t.getDataPath());
    t.addField(L"n", FIELD_INT32);
    EXPECT_FALSE(t.create());
    EXPECT_FALSE(t.open());
    EXPECT_EQ(-21, t.lock());
    EXPECT_EQ(-21, t.lock(100));
    FS_Table u(nullptr, wdir.c_str(), false);
    EXPECT_FALSE(u.create());
}

TEST_F(TableTest, LockUsesTheTableLockFileWhichTheDestructorRemoves) {
    {
        auto t = table(L"locked");
        EXPECT_TRUE(testsupport::fileExists(locks.file("locked_t_mutex")));
        EXPECT_EQ(0, t->lock());
        EXPECT_EQ(0, t->unlock());
        EXPECT_EQ(0, t->lock(100));
        EXPECT_EQ(0, t->unlock());
    }
    EXPECT_FALSE(testsupport::fileExists(locks.file("locked_t_mutex")));
}

TEST(RecordHeaderTest, StartsAt110ZeroZeroAndCopiesAllThree) {
    RecordHeader h;
    EXPECT_EQ(110u, h.tag);
    EXPECT_EQ(0u, h.first);
    EXPECT_EQ(0u, h.second);
    h.first = 5;
    h.second = 6;
    RecordHeader c(h);
    EXPECT_EQ(110u, c.tag);
    EXPECT_EQ(5u, c.first);
    EXPECT_EQ(6u, c.second);
    RecordHeader d;
    d = h;
    EXPECT_EQ(6u, d.second);
}

}  // namespace

namespace {

TEST(HashTest, EmptyKeyIsZeroAndOneLetterTakesTheTerminatorRound) {
    EXPECT_EQ(0, hash(L"", 65536));
    EXPECT_EQ(2405, hash(L"A", 65536));  // 65 * 37: the terminator's round multiplies once more
    EXPECT_EQ(1961, hash(L"5", 65536));
}

TEST(HashTest, NegativeAccumulatorComesBackInRange) {
    // Long keys wrap the signed accumulator; every result stays in 0..65535.
    std::wstring key(40, L'\x7fff');
    for (int i = 0; i < 40; ++i) {
        key[i] = static_cast<wchar_t>(0x4e00 + i * 977);
        int h = hash(key.c_str(), 65536);
        EXPECT_GE(h, 0);
        EXPECT_LT(h, 65536);
    }
    EXPECT_EQ(65535, hash(0xFFFFFFFFu, 65536));  // -1 as signed
    EXPECT_EQ(7, hash(7u, 65536));
}

TEST_F(TableTest, IndexWriteKeepsTheNewestAtTheHeadAndMovesOlderToOverflow) {
    Index idx(L"ix", wdir.c_str(), L"n");
    EXPECT_EQ(wide(dir.path() + "/ix.idx"), std::wstring(idx.getIndexFullPathName()));
    ASSERT_TRUE(idx.create());
    ASSERT_TRUE(idx.write(9, 100));
    ASSERT_TRUE(idx.write(9, 101));
    unsigned int id = 0, next = 0;
    ASSERT_TRUE(idx.read(9, &id, &next));
    EXPECT_EQ(101u, id);
    EXPECT_EQ(65536u, next);
    ASSERT_TRUE(idx.write(9, 102));
    ASSERT_TRUE(idx.read(9, &id, &next));
    EXPECT_EQ(102u, id);
    EXPECT_EQ(65537u, next);
    ASSERT_TRUE(idx.read(65537, &id, &next));
    EXPECT_EQ(101u, id);
    EXPECT_EQ(65536u, next);
    ASSERT_TRUE(idx.read(65536, &id, &next));
    EXPECT_EQ(100u, id);
    EXPECT_EQ(0xFFFFFFFFu, next);
    ASSERT_TRUE(idx.close());
    EXPECT_EQ(65538u * 8, file("ix.idx").size());
    EXPECT_TRUE(idx.erase());
    EXPECT_FALSE(testsupport::fileExists(dir.file("ix.idx")));
}

TEST_F(TableTest, InsertFeedsTheListedIndexesAndTheListSurvivesReopenAndErase) {
    {
        auto t = table(L"indexed");
        t->addField(L"n", FIELD_INT32);
        t->addField(L"s", FIELD_TEXT);
        ASSERT_TRUE(t->create());
        Index* byName = new Index(L"indexed_s", wdir.c_str(), L"s");
        ASSERT_TRUE(byName->create());
        t->getIndexes().push_back(byName);
        ASSERT_TRUE(t->saveHashIndexList(t->getIndexes()));
        Fields rec(t->getFields());
        static_cast<Int32Field*>(rec.at(0))->value(5);
        static_cast<TextField*>(rec.at(1))->value(L"a");
        ASSERT_TRUE(t->insert(rec));
        unsigned int id = 7, next = 7;
        ASSERT_TRUE(byName->read(static_cast<unsigned int>(hash(L"A", 65536)), &id, &next));
        EXPECT_EQ(0u, id);  // keyed by the upper-case text
        EXPECT_EQ(0xFFFFFFFFu, next);
    }
    std::string list = file("indexed_idx.dat");
    std::string expected = bytes({110, 0, 0, 0, 36, 0, 0, 0});
    for (wchar_t c : std::wstring(L"indexed_s")) expected += bytes({static_cast<int>(c), 0, 0, 0});
    expected += bytes({4, 0, 0, 0, 's', 0, 0, 0});
    EXPECT_EQ(hex(expected), hex(list));

    auto t = table(L"indexed");
    ASSERT_TRUE(t->open());
    ASSERT_EQ(1u, t->getIndexes().size());
    EXPECT_STREQ(L"s", t->getIndexes()[0]->getFieldName());
    EXPECT_EQ(t->getIndexes()[0], t->searchHashIndexForIndexName(L"indexed_s", false));
    EXPECT_EQ(nullptr, t->searchHashIndexForFieldName(L"n", false));
    ASSERT_TRUE(t->close());
    EXPECT_TRUE(t->erase());
    EXPECT_FALSE(testsupport::fileExists(dir.file("indexed_s.idx")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("indexed_idx.dat")));
}

TEST_F(TableTest, InsertFailsWhenAnIndexNamesAFieldTheRecordLacks) {
    auto t = table(L"badidx");
    t->addField(L"n", FIELD_INT32);
    ASSERT_TRUE(t->create());
    Index* idx = new Index(L"badidx_x", wdir.c_str(), L"x");
    ASSERT_TRUE(idx->create());
    t->getIndexes().push_back(idx);
    Fields rec(t->getFields());
    EXPECT_FALSE(t->insert(rec));
    unsigned int stored = 0;
    ASSERT_TRUE(t->count(0, &stored));
    EXPECT_EQ(1u, stored);  // the record itself went in
}

}  // namespace

namespace {

TEST_F(TableTest, AddHashIndexBuildsOverLiveRecordsAndLookupsSkipRemovedOnes) {
    auto t = table(L"look");
    t->addField(L"n", FIELD_INT32);
    t->addField(L"s", FIELD_TEXT);
    ASSERT_TRUE(t->create());
    Fields rec(t->getFields());
    const wchar_t* names[] = {L"alpha", L"Beta", L"alpha", L"gamma"};
    for (unsigned int i = 0; i < 4; ++i) {
        static_cast<Int32Field*>(rec.at(0))->value(i);
        static_cast<TextField*>(rec.at(1))->value(names[i]);
        ASSERT_TRUE(t->insert(rec));
    }
    ASSERT_TRUE(t->addHashIndex(L"look_s", L"s"));
    EXPECT_FALSE(t->addHashIndex(L"look_s", L"n"));  // name already present
    EXPECT_FALSE(t->addHashIndex(L"look_x", L"missing"));
    Index* idx = t->searchHashIndexForFieldName(L"s", false);
    ASSERT_NE(nullptr, idx);

    unsigned int id = 99, next = 0;
    ASSERT_TRUE(t->hashIndex_moveFirst(*idx, L"ALPHA", id, next));
    EXPECT_EQ(2u, id);  // newest first
    ASSERT_TRUE(t->hashIndex_moveNext(*idx, id, next));
    EXPECT_EQ(0u, id);
    EXPECT_FALSE(t->hashIndex_moveNext(*idx, id, next));

    ASSERT_TRUE(t->remove(2));
    ASSERT_TRUE(t->hashIndex_moveFirst(*idx, L"ALPHA", id, next));
    EXPECT_EQ(0u, id);  // the removed record's entry stands but is skipped
    EXPECT_FALSE(t->hashIndex_moveFirst(*idx, L"DELTA", id, next));

    // Records inserted later enter the index through insert.
    static_cast<TextField*>(rec.at(1))->value(L"delta");
    ASSERT_TRUE(t->insert(rec));
    ASSERT_TRUE(t->hashIndex_moveFirst(*idx, L"DELTA", id, next));
    EXPECT_EQ(4u, id);
}

TEST_F(TableTest, RemoveHashIndexReturnsFalseAndTheFileIsGone) {
    auto t = numbers(L"rmi", 3);
    ASSERT_TRUE(t->addHashIndex(L"rmi_n", L"n"));
    EXPECT_TRUE(testsupport::fileExists(dir.file("rmi_n.idx")));
    EXPECT_FALSE(t->removeHashIndex(L"rmi_n"));
    EXPECT_FALSE(testsupport::fileExists(dir.file("rmi_n.idx")));
    EXPECT_EQ(0u, t->getIndexes().size());
    EXPECT_FALSE(t->removeHashIndex(L"rmi_n"));
}

TEST_F(TableTest, CreateDropsTheListSoTheNextOpenHasNoIndexesWhileOldIndexFilesStay) {
    {
        auto t = numbers(L"recreate", 2);
        ASSERT_TRUE(t->addHashIndex(L"recreate_n", L"n"));
    }
    {
        auto t = table(L"recreate");
        ASSERT_TRUE(t->open());
        EXPECT_EQ(1u, t->getIndexes().size());
        ASSERT_TRUE(t->close());
        t->addField(L"n", FIELD_INT32);
        ASSERT_TRUE(t->create());
    }
    auto t = table(L"recreate");
    ASSERT_TRUE(t->open());
    EXPECT_EQ(0u, t->getIndexes().size());
    EXPECT_TRUE(testsupport::fileExists(dir.file("recreate_n.idx")));
}

TEST_F(TableTest, IntegerKeysAreTheirDecimalText) {
    auto t = numbers(L"intkey", 3);
    ASSERT_TRUE(t->addHashIndex(L"intkey_n", L"n"));
    Index* idx = t->searchHashIndexForIndexName(L"intkey_n", false);
    ASSERT_NE(nullptr, idx);
    unsigned int id = 0, next = 0;
    ASSERT_TRUE(t->hashIndex_moveFirst(*idx, L"2", id, next));
    EXPECT_EQ(2u, id);
}

}  // namespace

// A text key is filed under hash() of the text as wcsupper upper-cases it:
// ASCII, letters the locale upper-cases, letters it does not, characters
// outside the basic plane, and a name longer than 255 characters.
TEST_F(TableTest, TextKeysAreFiledUnderTheBucketOfTheirUpperCase) {
    std::string saved = std::setlocale(LC_CTYPE, nullptr);
    bool utf8 = std::setlocale(LC_CTYPE, "C.UTF-8") != nullptr;
    std::vector<std::wstring> names = {L"plain.txt", L"MiXeD.C", L"caf\u00e9.txt", L"stra\u00dfe", L"\u0131d\u0130",
                                       L"\u00ff\u0178", L"x\U0001F600y", L"", std::wstring(300, L'a') + L"\u00e9"};
    {
        auto t = table(L"keys");
        t->addField(L"name", FIELD_TEXT);
        ASSERT_TRUE(t->create());
        ASSERT_TRUE(t->addHashIndex(L"keys_name", L"name"));
        Fields rec(t->getFields());
        for (const std::wstring& name : names) {
            setText(rec, 0, name.c_str());
            ASSERT_TRUE(t->insert(rec));
        }
        Index* index = t->searchHashIndexForFieldName(L"name", false);
        ASSERT_NE(nullptr, index);
        for (unsigned int i = 0; i < names.size(); ++i) {
            std::vector<wchar_t> key(names[i].begin(), names[i].end());
            key.push_back(L'\0');
            wcsupper(key.data());
            bool found = false;
            unsigned int id = 0, next = 0;
            for (bool row = t->hashIndex_moveFirst(*index, key.data(), id, next); row && !found;
                 row = t->hashIndex_moveNext(*index, id, next))
                found = id == i;
            EXPECT_TRUE(found) << "record " << i;
        }
    }
    std::setlocale(LC_CTYPE, saved.c_str());
    if (!utf8) GTEST_SKIP() << "no C.UTF-8 locale: only the C locale's upper case was tried";
}
