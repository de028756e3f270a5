// Reading one text column of a record without decoding the record, and the
// one-read decode of whole records: the stored bytes come back as written,
// a record that the full read would refuse is never peeked, and the values a
// read leaves in the buffer are those of the field-by-field read.
#include "fscanner/fscommon/table.h"

#include <gtest/gtest.h>

#include <cstring>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

class TablePeekTest : public ::testing::TestWithParam<bool> {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
        t.reset(new FS_Table(L"files", wdir.c_str(), GetParam()));
        t->addField(L"FILENAME", FIELD_TEXT);
        t->addField(L"ATTR", FIELD_INT32);
        t->addField(L"SIZE", FIELD_INT64);
        t->addField(L"PATHID", FIELD_INT32);
        t->addField(L"MD5", FIELD_TEXT);
        t->addField(L"SMALL", FIELD_INT8);
        t->addField(L"MID", FIELD_INT16);
        ASSERT_TRUE(t->create());
        t->addHashIndex(L"files_FILENAME", L"FILENAME");
        t->addHashIndex(L"files_PATHID", L"PATHID");
    }
    void TearDown() override {
        t.reset();
        std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore);
    }
    void insert(const std::wstring& name, unsigned long long size, unsigned int pathId) {
        Fields rec(t->getFields());
        static_cast<TextField*>(rec.at(0))->value(name.c_str());
        static_cast<Int32Field*>(rec.at(1))->value(0x1000u + pathId);
        static_cast<Int64Field*>(rec.at(2))->value(size);
        static_cast<Int32Field*>(rec.at(3))->value(pathId);
        static_cast<TextField*>(rec.at(4))->value(L"d41d8cd98f00b204e9800998ecf8427e");
        static_cast<Int8Field*>(rec.at(5))->value(static_cast<unsigned char>(pathId));
        static_cast<Int16Field*>(rec.at(6))->value(static_cast<unsigned short>(pathId * 7));
        ASSERT_TRUE(t->insert(rec));
    }
    std::string peek(unsigned int id, bool* ascii = nullptr) {
        const unsigned char* text = nullptr;
        uint32_t length = 0;
        if (!t->peekText(id, 0, &text, &length, ascii)) return "<refused>";
        return std::string(reinterpret_cast<const char*>(text), length);
    }
    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[sizeof LinuxSharedMutex::storePath];
    std::unique_ptr<FS_Table> t;
};

const std::vector<std::wstring>& names() {
    static const std::vector<std::wstring> list = {
        L"a.c", L"", L"caf\u00e9.txt", std::wstring(90, L'n') + L".long",  // past the first read
        std::wstring(300, L'm'),                                          // past the inline text
        L"\u65e5\u672c\u8a9e.md", L"last"};
    return list;
}

}  // namespace

TEST_P(TablePeekTest, PeekGivesTheStoredBytesOfEveryRecord)
{
    for (size_t i = 0; i < names().size(); ++i) insert(names()[i], 1000000007ull * i, static_cast<unsigned int>(i + 1));
    for (bool guarded : {false, true}) {
        if (guarded) ASSERT_TRUE(t->verify());
        for (unsigned int id = 0; id < names().size(); ++id) {
            bool ascii = false;
            std::string got = peek(id, &ascii);
            std::wstring name = names()[id];
            bool plain = true;
            for (wchar_t c : name) plain = plain && c < 0x80;
            if (guarded && !plain) {
                // The guard's key check of a name beyond ASCII is left to
                // the full read.
                EXPECT_EQ("<refused>", got);
                continue;
            }
            ASSERT_NE("<refused>", got) << id;
            EXPECT_EQ(plain, ascii) << id;
            if (plain) EXPECT_EQ(std::string(name.begin(), name.end()), got);
            else EXPECT_GT(got.size(), name.size());  // multibyte UTF-8
        }
    }
    EXPECT_EQ("<refused>", peek(static_cast<unsigned int>(names().size())));  // past the last slot
    const unsigned char* text;
    uint32_t length;
    EXPECT_FALSE(t->peekText(0, 1, &text, &length));  // not a text column
    EXPECT_FALSE(t->peekText(0, 99, &text, &length));
}

TEST_P(TablePeekTest, ReadDecodesEveryColumnAsWritten)
{
    for (size_t i = 0; i < names().size(); ++i) insert(names()[i], 1000000007ull * i, static_cast<unsigned int>(i + 1));
    ASSERT_TRUE(t->verify());
    Fields rec(t->getFields());
    for (unsigned int id = 0; id < names().size(); ++id) {
        ASSERT_TRUE(t->read(id, rec)) << id;
        EXPECT_EQ(names()[id], std::wstring(static_cast<TextField*>(rec.at(0))->value()));
        EXPECT_EQ(0x1000u + id + 1, static_cast<Int32Field*>(rec.at(1))->value());
        EXPECT_EQ(1000000007ull * id, static_cast<Int64Field*>(rec.at(2))->value());
        EXPECT_EQ(id + 1, static_cast<Int32Field*>(rec.at(3))->value());
        EXPECT_EQ(std::wstring(L"d41d8cd98f00b204e9800998ecf8427e"),
                  std::wstring(static_cast<TextField*>(rec.at(4))->value()));
        EXPECT_EQ(static_cast<unsigned char>(id + 1), static_cast<Int8Field*>(rec.at(5))->value());
        EXPECT_EQ(static_cast<unsigned short>((id + 1) * 7), static_cast<Int16Field*>(rec.at(6))->value());
        for (unsigned int c = 0; c < rec.count(); ++c) EXPECT_FALSE(rec.at(c)->isNull());
    }
    EXPECT_FALSE(t->isDamaged());
}

TEST_P(TablePeekTest, ARemovedRecordIsNeverPeeked)
{
    insert(L"one", 1, 1);
    insert(L"two", 2, 2);
    ASSERT_TRUE(t->remove(0));
    EXPECT_EQ("<refused>", peek(0));
    EXPECT_EQ("two", peek(1));
}

TEST_P(TablePeekTest, ARecordWhoseNextSlotDisagreesIsLeftToTheGuardedRead)
{
    insert(L"one", 1, 1);
    insert(L"two", 2, 2);
    insert(L"three", 3, 3);
    ASSERT_TRUE(t->verify());
    // Point the second slot one byte further: the first record no longer
    // ends where the next one starts, and the second is cut at its front.
    t->close();
    std::string pointer = testsupport::readFile(dir.file("files.pxx"));
    ASSERT_GE(pointer.size(), 12u);
    uint32_t second;
    std::memcpy(&second, pointer.data() + 4, 4);  // slot 1: no header, 4 bytes a slot
    ++second;
    std::memcpy(&pointer[4], &second, 4);
    {
        std::ofstream out(dir.file("files.pxx"), std::ios::binary | std::ios::trunc);
        out.write(pointer.data(), static_cast<std::streamsize>(pointer.size()));
    }
    ASSERT_TRUE(t->open());
    t->verify();
    EXPECT_EQ("<refused>", peek(0));
    Fields rec(t->getFields());
    EXPECT_FALSE(t->read(0, rec));
    EXPECT_TRUE(t->isDamaged());
}

INSTANTIATE_TEST_SUITE_P(PlainAndCompressed, TablePeekTest, ::testing::Values(false, true));
