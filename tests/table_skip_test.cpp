// A walk with a byte filter on the names passes over the rows the filter
// turns away inside the table (skipRejected), in blocks, instead of one
// moveNext and one peekText a row.  It must be the same walk: on a sound
// table and on every damaged copy of it, the rows that reach the full read,
// what those reads give, where the walk stops and the damage the table
// notes are those of the row-by-row walk.
#include "fscanner/fscommon/table.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fstream>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

std::string narrow(wchar_t const* s) {
    std::string out;
    for (; s != nullptr && *s != 0; ++s) out += *s < 128 ? static_cast<char>(*s) : '?';
    return out;
}

void writeFile(const std::string& path, const std::string& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
}

// The filter: names that do not end in ".c".
bool notDotC(void* context, const unsigned char* bytes, uint32_t length) {
    if (context != nullptr) ++*static_cast<unsigned int*>(context);
    return !(length >= 2 && bytes[length - 2] == '.' && bytes[length - 1] == 'c');
}

const char* const kFiles[] = {"files.dat", "files.pxx", "files_FILENAME.idx", "files_PATHID.idx", "files_idx.dat"};

struct Walk {
    bool verified = false;
    std::vector<std::string> rows;  // each row read whole, or the read that failed
    bool damaged = false;
    std::string check;
    std::wstring file;
    unsigned int decided = 0;  // rows decided one by one through peekText
    unsigned int hinted = 0;   // rows skipRejected named as wanted, read without a peek
};

bool operator==(const Walk& a, const Walk& b) {
    return a.verified == b.verified && a.rows == b.rows && a.damaged == b.damaged && a.check == b.check &&
           a.file == b.file;
}

std::ostream& operator<<(std::ostream& out, const Walk& w) {
    out << "verified " << w.verified << ", " << w.rows.size() << " rows read";
    if (!w.rows.empty()) out << " (last: " << w.rows.back() << ")";
    return out << ", damage: " << (w.damaged ? w.check : "none");
}

// The walk of a cursor with a name filter over the open table t: every row
// decided on its peeked name in column, read whole when the filter may want
// it (describe(id, record) is what the walk keeps of it); with skip, the rows
// the filter turns away are passed over in the table first.
template <class Describe>
Walk walkNotDotC(FS_Table& t, unsigned int column, bool skip, unsigned int* rejected, Describe describe) {
    Walk w;
    unsigned int id = 0;
    unsigned int wanted = FS_Table::kNoRow;
    for (bool row = t.moveFirst(id); row; row = t.moveNext(id)) {
        bool turnedAway = false;
        if (skip && id == wanted) {
            ++w.hinted;
        } else {
            ++w.decided;
            const unsigned char* text = nullptr;
            uint32_t length = 0;
            bool ascii = false;
            turnedAway = t.peekText(id, column, &text, &length, &ascii) && ascii && notDotC(nullptr, text, length);
        }
        if (!turnedAway) {
            Fields rec(t.getFields());
            if (!t.read(id, rec)) {
                w.rows.push_back(std::to_string(id) + " read failed");
                break;
            }
            w.rows.push_back(describe(id, rec));
        }
        if (skip) t.skipRejected(id, column, notDotC, rejected, &wanted);
    }
    w.damaged = t.isDamaged();
    if (t.damagedCheck() != nullptr) w.check = t.damagedCheck();
    if (t.damagedFile() != nullptr) w.file = t.damagedFile();
    return w;
}

// walkNotDotC over a table of dir opened for it, checked at open.
template <class Describe>
Walk openAndWalk(const std::wstring& name, const std::wstring& dir, unsigned int column, bool skip, Describe describe) {
    FS_Table t(name.c_str(), dir.c_str(), true);
    if (!t.open()) return Walk();
    bool verified = t.verify();
    Walk w = walkNotDotC(t, column, skip, nullptr, describe);
    w.verified = verified;
    return w;
}

class TableSkipTest : public ::testing::TestWithParam<bool> {
protected:
    void SetUp() override {
        ASSERT_TRUE(locks.ok());
        wdir = wide(dir.path() + "/");
        t.reset(newTable());
        addFields(t.get());
        ASSERT_TRUE(t->create());
        ASSERT_TRUE(t->addHashIndex(L"files_FILENAME", L"FILENAME"));
        ASSERT_TRUE(t->addHashIndex(L"files_PATHID", L"PATHID"));
        for (unsigned int i = 0; i < kRows; ++i) insert(i);
        // Removed slots on the way, and at the very end.
        for (unsigned int i = 5; i < kRows; i += 29) ASSERT_TRUE(t->remove(i));
        ASSERT_TRUE(t->remove(32));
        ASSERT_TRUE(t->remove(kRows - 1));
        t->close();
        for (const char* name : kFiles) pristine[name] = testsupport::readFile(path(name));
    }
    void TearDown() override { t.reset(); }
    // An open table takes its columns from the file.
    FS_Table* newTable() { return new FS_Table(L"files", wdir.c_str(), GetParam()); }
    static void addFields(FS_Table* table) {
        table->addField(L"FILENAME", FIELD_TEXT);
        table->addField(L"ATTR", FIELD_INT32);
        table->addField(L"SIZE", FIELD_INT64);
        table->addField(L"PATHID", FIELD_INT32);
        table->addField(L"MD5", FIELD_TEXT);
        table->addField(L"SMALL", FIELD_INT8);
        table->addField(L"MID", FIELD_INT16);
    }
    // Names that end in ".c" and others, plain ASCII and not, short and
    // long; a few records longer than a block; null sizes.
    void insert(unsigned int i) {
        Fields rec(t->getFields());
        std::wstring name = L"f" + std::to_wstring(i) + (i % 7 == 0 ? L".c" : L".h");
        if (i % 11 == 0) name = L"n\u00e9" + std::to_wstring(i) + L".c";
        if (i % 13 == 0) name = std::wstring(280, L'L') + std::to_wstring(i) + L".h";
        if (i % 19 == 0) name = L"same.c";
        if (i == 300) name = std::wstring(9000, L'B') + L".h";
        // Two rows alike in both keys, each followed by a removed slot.
        if (i == 31 || i == 33) name = L"dup.h";
        std::wstring md5 = L"d41d8cd98f00b204e9800998ecf8427e";
        if (i % 97 == 0) md5 = std::wstring(3000, L'm');
        if (i == 300) md5 = std::wstring(60000, L'M');
        if (i % 23 == 0) md5 = L"\u00e9" + std::to_wstring(i) + L".h";
        unsigned int pathId = i / 20 + 1;
        static_cast<TextField*>(rec.at(0))->value(name.c_str());
        static_cast<Int32Field*>(rec.at(1))->value(0x81A4u + i);
        static_cast<Int64Field*>(rec.at(2))->value(i % 5 == 0 ? 0ull : 1000ull * i * i);
        if (i % 17 == 0) rec.at(2)->setNull(true);
        static_cast<Int32Field*>(rec.at(3))->value(pathId);
        static_cast<TextField*>(rec.at(4))->value(md5.c_str());
        static_cast<Int8Field*>(rec.at(5))->value(static_cast<unsigned char>(i));
        static_cast<Int16Field*>(rec.at(6))->value(static_cast<unsigned short>(i * 7));
        ASSERT_TRUE(t->insert(rec));
    }
    std::string path(const std::string& name) { return dir.path() + "/" + name; }
    void restore(const std::string& name) { writeFile(path(name), pristine[name]); }
    // walkNotDotC over the table opened anew, each row read kept with its
    // number and most of its columns.
    Walk walk(bool skip, unsigned int* rejected = nullptr, unsigned int column = 0) {
        t.reset(newTable());
        if (!t->open()) return Walk();
        bool verified = t->verify();
        Walk w = walkNotDotC(*t, column, skip, rejected, [](unsigned int id, Fields& rec) {
            std::string line = std::to_string(id) + " " + narrow(static_cast<TextField*>(rec.at(0))->value());
            line += " " + std::to_string(static_cast<Int64Field*>(rec.at(2))->value());
            line += rec.at(2)->isNull() ? " null" : "";
            line += " " + std::to_string(static_cast<Int32Field*>(rec.at(3))->value());
            line += " " + std::to_string(wcslen(static_cast<TextField*>(rec.at(4))->value()));
            line += " " + std::to_string(static_cast<Int16Field*>(rec.at(6))->value());
            return line;
        });
        w.verified = verified;
        t.reset();
        return w;
    }
    // Both walks over the table with damage done to the file name, which is
    // restored after each.
    template <class Damage>
    void compare(const std::string& what, const std::string& name, Damage damage) {
        damage();
        Walk rowByRow = walk(false);
        restore(name);
        damage();
        Walk skipping = walk(true);
        restore(name);
        EXPECT_EQ(rowByRow, skipping) << what;
        if (rowByRow.damaged) ++damagedSeen;
    }
    void flip(const std::string& name, size_t at, unsigned char mask) {
        std::string all = testsupport::readFile(path(name));
        if (at >= all.size()) return;
        all[at] = static_cast<char>(all[at] ^ mask);
        writeFile(path(name), all);
    }
    void putWord(const std::string& name, size_t at, uint32_t value) {
        std::string all = testsupport::readFile(path(name));
        if (at + 4 > all.size()) return;
        std::memcpy(&all[at], &value, 4);
        writeFile(path(name), all);
    }
    uint32_t word(const std::string& name, size_t at) {
        uint32_t v = 0;
        std::memcpy(&v, pristine[name].data() + at, 4);
        return v;
    }

    static const unsigned int kRows = 700;
    testsupport::LockStore locks;
    testsupport::TempDir dir;
    std::wstring wdir;
    std::unique_ptr<FS_Table> t;
    std::map<std::string, std::string> pristine;
    unsigned int damagedSeen = 0;
};

TEST_P(TableSkipTest, OnASoundTableTheRowsReadAreThoseOfTheRowByRowWalk) {
    Walk rowByRow = walk(false);
    unsigned int rejected = 0;
    Walk skipping = walk(true, &rejected);
    EXPECT_TRUE(rowByRow.verified) << rowByRow.check;
    EXPECT_FALSE(rowByRow.damaged);
    EXPECT_EQ(rowByRow, skipping);
    // Every ".c" name is read: the plain ones, the non-ASCII ones, "same.c".
    unsigned int expected = 0;
    for (unsigned int i = 0; i < kRows; ++i) {
        bool removed = (i >= 5 && (i - 5) % 29 == 0) || i == kRows - 1 || i == 32;
        bool dotC = i % 19 == 0 || (i % 13 != 0 && (i % 11 == 0 || i % 7 == 0));
        if (i == 300 || i == 31 || i == 33) dotC = false;
        if (!removed && dotC) ++expected;
    }
    EXPECT_EQ(rowByRow.rows.size(), expected);
    // The skipping walk decided most rows inside the table: only the rows
    // it stops at are decided one by one.
    EXPECT_LT(skipping.decided * 2, rowByRow.decided);
    EXPECT_GT(rejected, rowByRow.decided / 2);
    // Most rows read were named wanted by the table and not peeked again.
    EXPECT_GT(skipping.hinted * 2, skipping.rows.size());
}

TEST_P(TableSkipTest, AColumnWithoutIndexIsFilteredOnPlainAsciiOnly) {
    // MD5 holds no key: its bytes are checked for plain ASCII by the filter's
    // own test, and "\u00e9<n>.h" must reach the full read.
    Walk rowByRow = walk(false, nullptr, 4);
    Walk skipping = walk(true, nullptr, 4);
    EXPECT_FALSE(rowByRow.damaged);
    EXPECT_EQ(rowByRow, skipping);
    EXPECT_GT(rowByRow.rows.size(), kRows / 23 - 5);
    EXPECT_LT(skipping.decided * 2, rowByRow.decided);
}

TEST_P(TableSkipTest, ASlotThatDoesNotRiseIsLeftToTheWalkEvenWhenItsRecordFits) {
    // Row 33 pointed at row 31's record: both keys fit, the slots behind
    // both are removed, so only the walk's rising offsets tell.
    compare("slot 33 = slot 31", "files.pxx", [&] { putWord("files.pxx", 33 * 4, word("files.pxx", 31 * 4)); });
    EXPECT_EQ(damagedSeen, 1u);
}

TEST_P(TableSkipTest, ABlockOfRejectedRowsEndsAtTheRowBeforeTheNextCandidate) {
    t.reset(newTable());
    ASSERT_TRUE(t->open());
    ASSERT_TRUE(t->verify());
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    // Row 0 is "same.c"; the names are read so the keys are checked whole.
    Fields rec(t->getFields());
    ASSERT_TRUE(t->read(id, rec));
    // From row 1 the next ".c" is row 7; rows 1..6 are passed over (row 5
    // is removed).
    ASSERT_TRUE(t->moveNext(id));
    ASSERT_EQ(id, 1u);
    const unsigned char* text = nullptr;
    uint32_t length = 0;
    ASSERT_TRUE(t->peekText(id, 0, &text, &length));
    t->skipRejected(id, 0, notDotC, nullptr);
    EXPECT_EQ(id, 6u);
    ASSERT_TRUE(t->moveNext(id));
    EXPECT_EQ(id, 7u);
    // Without a walk standing at id nothing is passed over.
    unsigned int other = 20;
    t->skipRejected(other, 0, notDotC, nullptr);
    EXPECT_EQ(other, 20u);
    EXPECT_FALSE(t->isDamaged());
}

TEST_P(TableSkipTest, EveryDamageOfTheDataFileEndsBothWalksAlike) {
    const std::string& data = pristine["files.dat"];
    size_t header = word("files.pxx", 0);
    for (size_t at = header; at < data.size(); at += data.size() / 120 + 1) {
        for (unsigned char mask : {0x01, 0x80, 0x7F}) {
            compare("files.dat byte " + std::to_string(at) + " ^ " + std::to_string(mask), "files.dat",
                    [&] { flip("files.dat", at, mask); });
        }
    }
    // The data file cut short, inside the last records.
    for (size_t cut : {size_t(1), size_t(7), size_t(40)}) {
        compare("files.dat cut by " + std::to_string(cut), "files.dat", [&] {
            writeFile(path("files.dat"), data.substr(0, data.size() - cut));
        });
    }
    EXPECT_GT(damagedSeen, 40u);
}

TEST_P(TableSkipTest, EveryDamageOfThePointerFileEndsBothWalksAlike) {
    const std::string& slots = pristine["files.pxx"];
    for (size_t at = 0; at + 4 <= slots.size(); at += 4 * 13) {
        uint32_t v = word("files.pxx", at);
        for (uint32_t changed : {v + 1, v - 1, 0u, 0xFFFFFFFFu, word("files.pxx", at + 4 < slots.size() ? at + 4 : 0)}) {
            compare("files.pxx slot " + std::to_string(at / 4) + " = " + std::to_string(changed), "files.pxx",
                    [&] { putWord("files.pxx", at, changed); });
        }
    }
    compare("files.pxx cut", "files.pxx", [&] { writeFile(path("files.pxx"), slots.substr(0, slots.size() - 6)); });
    EXPECT_GT(damagedSeen, 50u);
}

TEST_P(TableSkipTest, EveryDamageOfAnIndexEndsBothWalksAlike) {
    for (const char* name : {"files_FILENAME.idx", "files_PATHID.idx"}) {
        const std::string& index = pristine[name];
        // The overflow slots behind the buckets, and buckets all over.
        size_t overflow = static_cast<size_t>(Index::BUCKETS) * 8;
        for (size_t at = overflow; at < index.size(); at += 4 * 5) {
            compare(std::string(name) + " byte " + std::to_string(at), name, [&] { flip(name, at, 0x03); });
        }
        for (size_t at = 0; at < overflow; at += overflow / 47 + 1) {
            compare(std::string(name) + " bucket byte " + std::to_string(at), name, [&] { flip(name, at, 0x01); });
        }
    }
    EXPECT_GT(damagedSeen, 20u);
}

INSTANTIATE_TEST_SUITE_P(PlainAndCompressed, TableSkipTest, ::testing::Values(false, true));

// A table of its own in a directory of its own, for the tests below, with a
// lock store of its own.
class TableSkipOwnTable : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(locks.ok()); }
    testsupport::LockStore locks;
    testsupport::TempDir dir;
    std::wstring wdir = wide(dir.path() + "/");
};
using TableSkipWideKey = TableSkipOwnTable;
using TableSkipKeyLengths = TableSkipOwnTable;
using TableSkipColumns = TableSkipOwnTable;

// A compressed 16-bit key stored with bits above its width (a 3-byte group
// number has room for 21) is cut to 16 bits by the full read, so its row is
// filed where the cut value belongs.  The rows skipRejected passes over must
// cut it the same way: uncut, the key would not be where its row is filed,
// and the table would leave every such row to be decided one by one.
TEST_F(TableSkipWideKey, AKeyStoredWiderThanItsColumnIsCutAsTheFullReadCutsIt) {
    const unsigned int kRows = 60;
    const unsigned short kWide = 40000;  // groups 2, 56, 64: bytes 05 71 80
    {
        FS_Table t(L"wide", wdir.c_str(), true);
        t.addField(L"NAME", FIELD_TEXT);
        t.addField(L"KEY", FIELD_INT16);
        ASSERT_TRUE(t.create());
        ASSERT_TRUE(t.addHashIndex(L"wide_KEY", L"KEY"));
        for (unsigned int i = 0; i < kRows; ++i) {
            Fields rec(t.getFields());
            std::wstring name = L"n" + std::to_wstring(i) + (i % 10 == 9 ? L".c" : L".h");
            static_cast<TextField*>(rec.at(0))->value(name.c_str());
            static_cast<Int16Field*>(rec.at(1))->value(kWide);
            ASSERT_TRUE(t.insert(rec));
        }
        t.close();
    }
    // Every row's key gets bit 16 set: its top group 2 becomes 6.
    std::string data = testsupport::readFile(dir.path() + "/wide.dat");
    unsigned int widened = 0;
    for (size_t at = 0; at + 3 <= data.size(); ++at) {
        if (data.compare(at, 3, std::string("\x05\x71\x80", 3)) == 0) {
            data[at] = '\x0d';
            ++widened;
        }
    }
    ASSERT_EQ(widened, kRows);
    writeFile(dir.path() + "/wide.dat", data);

    auto walk = [&](bool skip) {
        return openAndWalk(L"wide", wdir, 0, skip, [](unsigned int, Fields& rec) {
            return narrow(static_cast<TextField*>(rec.at(0))->value()) + " " +
                   std::to_string(static_cast<Int16Field*>(rec.at(1))->value());
        });
    };
    Walk rowByRow = walk(false);
    Walk skipping = walk(true);
    EXPECT_TRUE(rowByRow.verified);
    EXPECT_EQ(rowByRow, skipping);
    // The rows between two ".c" names were passed over inside the table.
    EXPECT_EQ(rowByRow.decided, kRows);
    EXPECT_LT(skipping.decided * 3, kRows);
    ASSERT_EQ(rowByRow.rows.size(), kRows / 10);
    EXPECT_EQ(rowByRow.rows.front(), "n9.c 40000");
    EXPECT_FALSE(rowByRow.damaged);
}

// A compressed 64-bit key of every stored length, one byte to ten, behind a
// run of two other numbers of every length: the rows skipRejected passes
// over find each key's value in the bytes as the full read does (a number of
// up to eight bytes gathered in one step, a longer one left to the full
// decoder; a run stepped over at once where it fits eight bytes, number by
// number where not), or their keys would not be where the index files them
// and every row would be decided one by one.
TEST_F(TableSkipKeyLengths, AKeyOfEveryStoredLengthIsReadAsTheFullReadReadsIt) {
    // The largest and the smallest value of each length: 7 bits a byte.
    std::vector<unsigned long long> values;
    for (unsigned int bits = 7; bits < 64; bits += 7) {
        values.push_back((1ull << bits) - 1);
        values.push_back(1ull << bits);
    }
    values.push_back(~0ull);
    const unsigned int kRows = static_cast<unsigned int>(values.size()) * 10;
    {
        FS_Table t(L"lengths", wdir.c_str(), true);
        t.addField(L"NAME", FIELD_TEXT);
        t.addField(L"FIRST", FIELD_INT64);
        t.addField(L"SECOND", FIELD_INT64);
        t.addField(L"KEY", FIELD_INT64);
        ASSERT_TRUE(t.create());
        ASSERT_TRUE(t.addHashIndex(L"lengths_KEY", L"KEY"));
        for (unsigned int i = 0; i < kRows; ++i) {
            Fields rec(t.getFields());
            std::wstring name = L"n" + std::to_wstring(i) + (i % 10 == 9 ? L".c" : L".h");
            static_cast<TextField*>(rec.at(0))->value(name.c_str());
            static_cast<Int64Field*>(rec.at(1))->value(values[(i / 3) % values.size()]);
            static_cast<Int64Field*>(rec.at(2))->value(values[(i * 7) % values.size()]);
            static_cast<Int64Field*>(rec.at(3))->value(values[i % values.size()]);
            ASSERT_TRUE(t.insert(rec));
        }
        t.close();
    }
    auto walk = [&](bool skip) {
        return openAndWalk(L"lengths", wdir, 0, skip, [](unsigned int, Fields& rec) {
            return narrow(static_cast<TextField*>(rec.at(0))->value()) + " " +
                   std::to_string(static_cast<Int64Field*>(rec.at(1))->value()) + " " +
                   std::to_string(static_cast<Int64Field*>(rec.at(2))->value()) + " " +
                   std::to_string(static_cast<Int64Field*>(rec.at(3))->value());
        });
    };
    Walk rowByRow = walk(false);
    Walk skipping = walk(true);
    EXPECT_TRUE(rowByRow.verified);
    EXPECT_EQ(rowByRow, skipping);
    EXPECT_EQ(rowByRow.decided, kRows);
    // Only the first row, which the walk reads before it skips, is decided
    // one by one: a key of nine or ten bytes goes to the full decoder inside
    // the table, and a key read wrong stops the skipping walk at its row.
    EXPECT_EQ(skipping.decided, 1u);
    ASSERT_EQ(rowByRow.rows.size(), kRows / 10);
    EXPECT_FALSE(rowByRow.damaged);
}

// The skipping walk over one column, then another, of the same open table,
// and again after the table is opened anew on files whose columns stand in
// another order (the filtered column and the key where they were): each
// walk skims the rows for its own columns, not for those of the walk before,
// and passes over every row it turns away.
TEST_F(TableSkipColumns, EachWalkSkimsForItsOwnColumns) {
    const unsigned int kRows = 90;
    // NAME ends in ".c" on every 10th row, OTHER on every 7th; the number
    // between them is long enough to move OTHER when it is not stepped over.
    auto make = [&](bool otherSecond) {
        FS_Table t(L"cols", wdir.c_str(), true);
        t.erase();
        t.addField(L"NAME", FIELD_TEXT);
        if (otherSecond) t.addField(L"OTHER", FIELD_TEXT);
        t.addField(L"NUMBER", FIELD_INT64);
        if (!otherSecond) t.addField(L"OTHER", FIELD_TEXT);
        ASSERT_TRUE(t.create());
        ASSERT_TRUE(t.addHashIndex(L"cols_NAME", L"NAME"));
        for (unsigned int i = 0; i < kRows; ++i) {
            Fields rec(t.getFields());
            std::wstring name = L"n" + std::to_wstring(i) + (i % 10 == 9 ? L".c" : L".h");
            std::wstring other = L"o" + std::to_wstring(i * 31) + (i % 7 == 3 ? L".c" : L".txt");
            static_cast<TextField*>(rec.at(rec.indexOf(L"NAME")))->value(name.c_str());
            static_cast<TextField*>(rec.at(rec.indexOf(L"OTHER")))->value(other.c_str());
            static_cast<Int64Field*>(rec.at(rec.indexOf(L"NUMBER")))->value(1ull << (i % 60));
            ASSERT_TRUE(t.insert(rec));
        }
        t.close();
    };
    // One table object for every walk.
    FS_Table t(L"cols", wdir.c_str(), true);
    auto walk = [&](const wchar_t* columnName, bool skip) {
        unsigned int column = static_cast<unsigned int>(t.getFields().indexOf(columnName));
        return walkNotDotC(t, column, skip, nullptr, [column](unsigned int, Fields& rec) {
            return narrow(static_cast<TextField*>(rec.at(column))->value());
        });
    };
    for (bool otherSecond : {false, true}) {
        make(otherSecond);
        // One opening for all the walks of a table.
        ASSERT_TRUE(t.open());
        ASSERT_TRUE(t.verify());
        for (const wchar_t* column : {L"NAME", L"OTHER", L"NAME"}) {
            Walk rowByRow = walk(column, false);
            Walk skipping = walk(column, true);
            std::string where = narrow(column) + (otherSecond ? ", OTHER second" : ", OTHER last");
            EXPECT_EQ(rowByRow, skipping) << where;
            EXPECT_EQ(rowByRow.rows.size(), std::wstring(column) == L"NAME" ? kRows / 10 : kRows / 7 + 1) << where;
            EXPECT_FALSE(rowByRow.damaged) << where;
            // Only the first row, read before the walk skips, one by one.
            EXPECT_EQ(skipping.decided, 1u) << where;
        }
        t.close();
    }
}

}  // namespace
