#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachetables.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/testsupport.h"

namespace {

std::wstring widen(const std::string& s) { return std::wstring(s.begin(), s.end()); }

std::string describe(FS_Table* table)
{
    std::string out;
    Fields& f = table->getFields();
    for (unsigned int i = 0; i < f.count(); ++i) {
        std::wstring n = f.at(i)->getName();
        out += std::string(n.begin(), n.end()) + ":" + std::to_string(f.at(i)->getType()) + " ";
    }
    return out;
}

std::string indexes(FS_Table* table)
{
    std::string out;
    for (Index* ix : table->getIndexes()) {
        std::wstring n = ix->getIndexName();
        std::wstring c = ix->getFieldName();
        out += std::string(n.begin(), n.end()) + "(" + std::string(c.begin(), c.end()) + ") ";
    }
    return out;
}

struct TablesTest : ::testing::Test {
    testsupport::TempDir locks;
    testsupport::TempDir dir;
    FsGlue glue;
    TablesTest() {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        glue.knownHashes = nullptr;
        glue.checksumFlags = 0;
        glue.reserved = 0;
        glue.cacheRemoteDrives = false;
    }
};

}  // namespace

TEST_F(TablesTest, CreatedTablesHaveColumnsAndIndexesInOrder)
{
    FS_Cache c(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
    EXPECT_EQ("ID:3 PATHNAME:5 PARENTID:3 CREATIONTIME:3 ", describe(c.tbDirectories));
    EXPECT_EQ("FILENAME:5 ATTR:3 SIZE:4 PATHID:3 MD5:5 CRC32:3 Q32:3 ", describe(c.tbFiles));
    EXPECT_EQ("dirs_PATHNAME(PATHNAME) dirs_ID(ID) dirs_PARENTID(PARENTID) ",
              indexes(c.tbDirectories));
    EXPECT_EQ("files_FILENAME(FILENAME) files_PATHID(PATHID) ", indexes(c.tbFiles));
    c.close();
}

TEST_F(TablesTest, ReopenedTablesKeepSchema)
{
    {
        FS_Cache c(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_CREATE));
        c.close();
    }
    FS_Cache c(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    EXPECT_EQ("ID:3 PATHNAME:5 PARENTID:3 CREATIONTIME:3 ", describe(c.tbDirectories));
    EXPECT_EQ("FILENAME:5 ATTR:3 SIZE:4 PATHID:3 MD5:5 CRC32:3 Q32:3 ", describe(c.tbFiles));
    c.close();
}

TEST_F(TablesTest, DefaultVariablesAndCriteriaAreBuiltInOrder)
{
    FS_Cache c(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_TRUE(c.cacheInitialized);
    ASSERT_NE(nullptr, c.defaultVariables);
    ASSERT_EQ(10u, c.defaultVariables->count());
    const char* names[10] = {"id", "pathid", "parentid", "pathname", "shortpathname",
                             "filename", "shortfilename", "md5", "crc32", "q32"};
    unsigned int types[10] = {3, 3, 3, 5, 5, 5, 5, 5, 3, 3};
    for (int i = 0; i < 10; ++i) {
        ASSERT_NE(nullptr, c.variableHandles[i]);
        EXPECT_EQ(widen(names[i]), std::wstring(c.variableHandles[i]->getName()));
        EXPECT_EQ(types[i], c.variableHandles[i]->getType());
        EXPECT_EQ(c.defaultVariables->at(i), c.variableHandles[i]);
    }
    const wchar_t* texts[7] = {
        L"[PATHID]==pathid",
        L"[PARENTID]==parentid",
        L"[ID]==id",
        L"[SHORTPATHNAME]==shortpathname || [PATHNAME]==pathname",
        L"[PATHNAME]==pathname",
        L"[PATHID]==pathid && ([FILENAME]==filename || [SHORTFILENAME]==shortfilename)",
        L"[PATHID]==pathid && [FILENAME]==filename"};
    for (int i = 0; i < 7; ++i) {
        ASSERT_NE(nullptr, c.criteria[i]);
        EXPECT_EQ(std::wstring(texts[i]), std::wstring(c.criteria[i]->getCriteria()));
    }
}

TEST_F(TablesTest, CreateTableWithoutNameFailsAndClearsSlot)
{
    FS_Cache c(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov");
    FS_Table* slot = reinterpret_cast<FS_Table*>(1);
    EXPECT_FALSE(c.createFilesTable(&slot, nullptr));
    EXPECT_EQ(nullptr, slot);
    slot = reinterpret_cast<FS_Table*>(1);
    EXPECT_FALSE(c.createDirectoriesTable(&slot, nullptr));
    EXPECT_EQ(nullptr, slot);
}
