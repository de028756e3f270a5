#include <gtest/gtest.h>

#include <algorithm>
#include <cwchar>
#include <memory>
#include <string>
#include <vector>

#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachetables.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

using testsupport::widen;

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
        glue = testsupport::plainGlue();
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

// ------------------------------------------------------------------ lookups

namespace {

struct LookupTest : TablesTest {
    std::unique_ptr<FS_Cache> cache;
    RecordSet first;
    RecordSet second;
    LookupTest() {
        cache.reset(new FS_Cache(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue,
                                 L"prov"));
        EXPECT_EQ(0, cache->create(0, FS_CACHE_CREATE));
        first = cache->tbDirectories->openRecordSet();
        second = cache->tbDirectories->openRecordSet();
    }
    ~LookupTest() override { cache->close(); }
    void addDir(unsigned int id, const wchar_t* name, unsigned int parent, unsigned int created = 1) {
        RecordSet rs = cache->tbDirectories->openRecordSet();
        rs.setFieldAsInt32(L"ID", id);
        rs.setFieldAsString(L"PATHNAME", name);
        rs.setFieldAsInt32(L"PARENTID", parent);
        rs.setFieldAsInt32(L"CREATIONTIME", created);
        ASSERT_TRUE(rs.insert());
        cache->tbDirectories->closeRecordSet(rs);
    }
    void addFile(const wchar_t* name, unsigned int pathId) {
        RecordSet rs = cache->tbFiles->openRecordSet();
        rs.setFieldAsString(L"FILENAME", name);
        rs.setFieldAsInt32(L"ATTR", 0);
        rs.setFieldAsInt64(L"SIZE", 1);
        rs.setFieldAsInt32(L"PATHID", pathId);
        rs.setFieldAsString(L"MD5", L"0");
        rs.setFieldAsInt32(L"CRC32", 0);
        rs.setFieldAsInt32(L"Q32", 0);
        ASSERT_TRUE(rs.insert());
        cache->tbFiles->closeRecordSet(rs);
    }
    // Ids of all live rows of a table, through a plain walk.
    std::vector<unsigned int> column(FS_Table* table, const wchar_t* name) {
        std::vector<unsigned int> out;
        RecordSet rs = table->openRecordSet();
        for (bool row = rs.moveFirst(); row; row = rs.moveNext())
            out.push_back(rs.getFieldAsInt32(name));
        table->closeRecordSet(rs);
        std::sort(out.begin(), out.end());
        return out;
    }
    bool byName(const wchar_t* path, bool caseSensitive) {
        std::vector<wchar_t> copy(path, path + wcslen(path) + 1);
        return cache->findPathByName(first, second, copy.data(), caseSensitive);
    }
    std::wstring byId(unsigned int id, unsigned int size = 4096) {
        std::vector<wchar_t> buffer(size + 1, L'#');
        if (!cache->findPathById(first, id, buffer.data(), size))
            return L"<false:" + std::wstring(buffer.data()) + L">";
        return buffer.data();
    }
    // /(1) usr(2) bin(3) lib(4); opt(5) under /, bin(6) under opt.
    void standardTree() {
        addDir(1, L"/", 0);
        addDir(6, L"bin", 5);
        addDir(2, L"usr", 1);
        addDir(3, L"bin", 2);
        addDir(4, L"lib", 2);
        addDir(5, L"opt", 1);
    }
};

}  // namespace

TEST_F(LookupTest, RootIsFoundAsTheSlashRowWithParentZero)
{
    addDir(7, L"/", 9);  // a "/" that is not at the top is not the root
    standardTree();
    ASSERT_TRUE(byName(L"/", true));
    EXPECT_EQ(1u, first.getFieldAsInt32(L"ID"));
    EXPECT_EQ(0u, first.getFieldAsInt32(L"PARENTID"));
}

TEST_F(LookupTest, CaseInsensitiveLookupFindsMixedCaseRows)
{
    standardTree();
    ASSERT_TRUE(byName(L"/USR/bin", false));
    EXPECT_EQ(3u, first.getFieldAsInt32(L"ID"));
    ASSERT_TRUE(byName(L"/usr/BIN", false));  // last component through the index, any case
    EXPECT_EQ(3u, first.getFieldAsInt32(L"ID"));
    EXPECT_FALSE(byName(L"/USR/bin", true));
    EXPECT_FALSE(byName(L"/usr/BIN", true));
}

TEST_F(LookupTest, WrongCandidateOfTheSameNameIsRejectedAndTheNextTried)
{
    standardTree();
    ASSERT_TRUE(byName(L"/usr/bin", true));
    EXPECT_EQ(3u, first.getFieldAsInt32(L"ID"));
    ASSERT_TRUE(byName(L"/opt/bin", true));
    EXPECT_EQ(6u, first.getFieldAsInt32(L"ID"));
    EXPECT_FALSE(byName(L"/srv/bin", true));
}

TEST_F(LookupTest, ChainThatDoesNotReachTheTopIsNotAMatch)
{
    addDir(3, L"bin", 2);
    addDir(2, L"usr", 8);  // parent 8 does not exist
    EXPECT_FALSE(byName(L"/usr/bin", true));
    EXPECT_FALSE(byName(L"usr/bin", true));
    EXPECT_FALSE(byName(L"bin", true));  // one component needs parent 0
    addDir(9, L"top", 0);
    EXPECT_TRUE(byName(L"top", true));
}

TEST_F(LookupTest, EmptyPathIsNotFound)
{
    standardTree();
    EXPECT_FALSE(byName(L"", true));
}

TEST_F(LookupTest, PathByIdRebuildsTheFullPath)
{
    standardTree();
    EXPECT_EQ(L"/usr/bin", byId(3));
    EXPECT_EQ(L"/opt/bin", byId(6));
    EXPECT_EQ(L"/", byId(1));
}

TEST_F(LookupTest, PathByIdZeroIsFalseWithAnEmptyBuffer)
{
    standardTree();
    EXPECT_EQ(L"<false:>", byId(0));
    EXPECT_FALSE(cache->findPathById(first, 3, nullptr, 10));
    wchar_t one[1] = {L'#'};
    EXPECT_FALSE(cache->findPathById(first, 3, one, 0));
    EXPECT_EQ(L'#', one[0]);
}

TEST_F(LookupTest, PathByIdRefusesABufferTooSmallInsteadOfCutting)
{
    standardTree();
    // "/usr/bin" is 8 characters; the prepend needs its length plus 4.
    EXPECT_EQ(L"<false:>", byId(3, 10));
    EXPECT_EQ(L"<false:>", byId(3, 11));
    EXPECT_EQ(L"/usr/bin", byId(3, 12));
    EXPECT_EQ(L"/", byId(1, 5));
    EXPECT_EQ(L"<false:>", byId(1, 4));
}

TEST_F(LookupTest, PathByIdFailsOnABrokenChain)
{
    addDir(3, L"bin", 2);  // 2 is missing
    EXPECT_EQ(L"<false:>", byId(3));
    EXPECT_EQ(L"<false:>", byId(42));
}

TEST_F(LookupTest, PathByIdAnswersFromTheMemoAndFlushesItWhenFull)
{
    standardTree();
    ASSERT_EQ(L"/usr/bin", byId(3));
    EXPECT_EQ(3u, cache->pathMemo.size());
    // The rows go; the memo still knows them.
    RecordSet rs = cache->tbDirectories->openRecordSet();
    for (bool row = rs.moveFirst(); row; row = rs.moveNext())
        rs.remove();
    cache->tbDirectories->closeRecordSet(rs);
    EXPECT_EQ(L"/usr/bin", byId(3));

    // 30 more ids bring the memo to 33 entries, past 32: the next walk
    // flushes it before it looks anything up.
    for (unsigned int id = 100; id < 131; ++id)
        addDir(id, (L"d" + std::to_wstring(id)).c_str(), 0);
    for (unsigned int id = 100; id < 130; ++id)
        ASSERT_EQ(L"d" + std::to_wstring(id), byId(id));
    EXPECT_EQ(33u, cache->pathMemo.size());
    EXPECT_EQ(L"d130", byId(130));
    EXPECT_EQ(1u, cache->pathMemo.size());
    EXPECT_EQ(L"<false:>", byId(3));  // forgotten, and the rows are gone
}

// The memo's keys and texts, in key order.
std::wstring memoOf(const FS_Cache& cache)
{
    std::wstring out;
    for (const auto& entry : cache.pathMemo)
        out += std::to_wstring(entry.first) + L"=" + entry.second.text + L"<" +
               std::to_wstring(entry.second.parentId) + L" ";
    return out;
}

// A walk that goes on from the last one answers, and leaves the memo, as the
// walk alone does after every step: over a deep tree visited in the order of
// a scan and out of it, with flushes of the memo in the middle of walks,
// buffers too small, rows gone that the memo still knows, an empty
// component and ids that do not exist.
TEST_F(LookupTest, PathByIdAlongTheLastWalkAnswersAndFillsTheMemoAsTheWalkAlone)
{
    std::vector<unsigned int> order;  // the order of a scan
    auto removeRows = [&]() {
        RecordSet rs = cache->tbDirectories->openRecordSet();
        for (bool row = rs.moveFirst(); row; row = rs.moveNext())
            rs.remove();
        cache->tbDirectories->closeRecordSet(rs);
    };
    // Three branches of 12 levels, each level with two leaves beside it.
    auto plant = [&]() {
        removeRows();
        order.clear();
        addDir(1, L"/", 0);
        unsigned int next = 2;
        for (int branch = 0; branch < 3; ++branch) {
            unsigned int parent = 1;
            for (int level = 0; level < 12; ++level) {
                unsigned int id = next++;
                addDir(id, (L"b" + std::to_wstring(branch) + L"l" + std::to_wstring(level)).c_str(), parent);
                order.push_back(id);
                for (int leaf = 0; leaf < 2; ++leaf) {
                    unsigned int leafId = next++;
                    addDir(leafId, (level == 5 && leaf == 1 ? L"" : L"leaf" + std::to_wstring(leaf)).c_str(), id);
                    order.push_back(leafId);
                }
                parent = id;
            }
        }
    };
    plant();
    std::vector<std::pair<unsigned int, unsigned int>> calls;  // id, buffer size
    for (unsigned int id : order)
        calls.push_back({id, 4096});
    // Walks of others in between, without the last walk (a size of 4095
    // marks them): they flush the memo under the last walk's chain.
    calls.push_back({order[20], 4096});
    calls.push_back({order[order.size() - 1], 4095});
    calls.push_back({order[order.size() - 40], 4095});
    calls.push_back({order[22], 4096});
    calls.push_back({order[25], 4096});
    // The memo emptied under a chain that holds (a size of 4094 marks it).
    calls.push_back({order[27], 4096});
    calls.push_back({order[28], 4096});
    calls.push_back({0, 4094});
    calls.push_back({order[29], 4096});
    // Back and forth across the branches, an id that is not there, the root.
    for (unsigned int i = 0; i < order.size(); i += 7)
        calls.push_back({order[order.size() - 1 - i], 4096});
    calls.push_back({999, 4096});
    calls.push_back({1, 4096});
    // Buffers the path does not fit, by one, and that it just fits.
    for (unsigned int i = 0; i + 2 < order.size(); i += 9) {
        std::wstring full = byId(order[i]);
        calls.push_back({order[i + 1], 4096});
        calls.push_back({order[i], static_cast<unsigned int>(full.size() + 3)});
        calls.push_back({order[i + 2], 4096});
        calls.push_back({order[i], static_cast<unsigned int>(full.size() + 4)});
    }
    cache->clearPathMemo();

    auto run = [&](bool along, bool rowsGo) {
        std::vector<std::wstring> seen;
        FS_CacheBase::PathChain chain;
        plant();
        for (size_t c = 0; c < calls.size(); ++c) {
            // The rows go; the memo, and what it knows, stays.
            if (rowsGo && c == order.size())
                removeRows();
            if (calls[c].second == 4094) {
                cache->clearPathMemo();
                seen.push_back(L"cleared");
                continue;
            }
            std::vector<wchar_t> buffer(calls[c].second + 1, L'#');
            bool found = along && calls[c].second != 4095
                             ? cache->findPathByIdAlong(first, calls[c].first, buffer.data(), calls[c].second, &chain)
                             : cache->findPathById(first, calls[c].first, buffer.data(), calls[c].second);
            seen.push_back(std::to_wstring(calls[c].first) + (found ? L" " : L" <false> ") + buffer.data() + L" | " +
                           memoOf(*cache));
        }
        cache->clearPathMemo();
        return seen;
    };
    std::vector<std::wstring> alone = run(false, false);
    std::vector<std::wstring> along = run(true, false);
    ASSERT_EQ(alone.size(), along.size());
    for (size_t i = 0; i < alone.size(); ++i)
        EXPECT_EQ(alone[i], along[i]) << "call " << i;
    // The deepest path is whole, and some walks failed on their buffer.
    EXPECT_NE(std::wstring::npos, alone[33].find(L"/b0l0/b0l1/b0l2/b0l3/b0l4/b0l5/b0l6/b0l7/b0l8/b0l9/b0l10/b0l11 "));
    size_t failures = 0;
    for (const std::wstring& line : alone)
        failures += line.find(L"<false>") != std::wstring::npos ? 1 : 0;
    EXPECT_GE(failures, 5u);

    std::vector<std::wstring> aloneGone = run(false, true);
    std::vector<std::wstring> alongGone = run(true, true);
    ASSERT_EQ(aloneGone.size(), alongGone.size());
    for (size_t i = 0; i < aloneGone.size(); ++i)
        EXPECT_EQ(aloneGone[i], alongGone[i]) << "call " << i;
}

TEST_F(LookupTest, RemoveTreeTakesRowsBelowAndTheirFilesAndKeepsParents)
{
    standardTree();
    addDir(7, L"share", 3);
    addFile(L"ls", 3);
    addFile(L"cat", 3);
    addFile(L"deep", 7);
    addFile(L"libc.so", 4);
    addFile(L"top", 2);
    addFile(L"tool", 6);
    cache->removeTree(cache->tbDirectories, cache->tbFiles, 2);  // /usr
    EXPECT_EQ((std::vector<unsigned int>{1, 5, 6}), column(cache->tbDirectories, L"ID"));
    EXPECT_EQ((std::vector<unsigned int>{6}), column(cache->tbFiles, L"PATHID"));
    EXPECT_TRUE(byName(L"/opt/bin", true));
    EXPECT_FALSE(byName(L"/usr", true));
}

TEST_F(LookupTest, RemoveTreeOfTheTopEmptiesBothTables)
{
    standardTree();
    addFile(L"a", 1);
    addFile(L"b", 4);
    cache->removeTree(cache->tbDirectories, cache->tbFiles, 1);
    EXPECT_TRUE(column(cache->tbDirectories, L"ID").empty());
    EXPECT_TRUE(column(cache->tbFiles, L"PATHID").empty());
}

TEST_F(LookupTest, RemoveFilesTakesOnlyThatDirectorysFiles)
{
    standardTree();
    addFile(L"a", 3);
    addFile(L"b", 3);
    addFile(L"c", 4);
    cache->removeFiles(cache->tbFiles, 3);
    EXPECT_EQ((std::vector<unsigned int>{4}), column(cache->tbFiles, L"PATHID"));
}

TEST_F(LookupTest, PathCommandGivesTheFullPathOfARow)
{
    standardTree();
    chPathCommand command(cache.get());
    ExpValue left, right, result;
    left.setNumericValue(3);
    right.setString(L"ls");
    EXPECT_EQ(0, command.execute(left, right, result));
    EXPECT_TRUE(result.isString());
    EXPECT_EQ(std::wstring(L"/usr/bin/ls"), result.getStringValue());
    left.setNumericValue(1);
    EXPECT_EQ(0, command.execute(left, right, result));
    EXPECT_EQ(std::wstring(L"/ls"), result.getStringValue());
}

TEST_F(LookupTest, PathCommandRefusesMissingArgumentsAndBrokenChains)
{
    standardTree();
    chPathCommand command(cache.get());
    ExpValue left, right, result;
    left.setNumericValue(3);
    right.setString(L"");
    testsupport::TraceCapture cap;
    EXPECT_NE(0, command.execute(left, right, result));
    EXPECT_TRUE(cap.contains("chPathCommand::execute - args not valid!"));
    right.setString(L"ls");
    left.setNumericValue(77);
    EXPECT_NE(0, command.execute(left, right, result));
    EXPECT_TRUE(cap.contains("chPathCommand::execute - findPathById(...) failed!"));
}

TEST_F(LookupTest, TypeCommandRefusesNonTextArguments)
{
    chTypeCommand command;
    ExpValue left, right, result;
    left.setNumericValue(1);
    right.setString(L"text");
    testsupport::TraceCapture cap;
    EXPECT_EQ(1, command.execute(left, right, result));
    EXPECT_TRUE(cap.contains("chTypeCommand::execute - args not valid!\n"));
}

TEST_F(LookupTest, TypeCommandAsksFileAboutThePath)
{
    // Needs the `file` command.
    if (testsupport::runCommand("command -v file").empty())
        GTEST_SKIP() << "the file command is not installed";
    dir.write("note.txt", "plain words\n");
    chTypeCommand command;
    ExpValue left, right, result;
    left.setString(widen(dir.file("note.txt")).c_str());
    right.setString(L"text");
    testsupport::TraceCapture cap;
    EXPECT_EQ(0, command.execute(left, right, result));
    EXPECT_TRUE(result.isNumeric());
    EXPECT_EQ(1u, result.getNumber());
    right.setString(L"ELF");
    EXPECT_EQ(0, command.execute(left, right, result));
    EXPECT_EQ(0u, result.getNumber());
    EXPECT_TRUE(cap.contains("chTypeCommand::execute - exit. [retValue is 0]\n"));
}
