// The path memo of findPathById on deep and wide trees: answers equal to a
// walk of the rows, a bounded memo, and the chain above the directory being
// resolved kept across the bound, so that a directory's ancestors are looked
// up once however many directories below them follow.
#include <gtest/gtest.h>

#include <cwchar>
#include <memory>
#include <string>
#include <vector>

#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachetables.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

using testsupport::widen;

struct PathMemoTest : ::testing::Test {
    testsupport::TempDir locks;
    testsupport::TempDir dir;
    FsGlue glue;
    std::unique_ptr<FS_Cache> cache;
    RecordSet cursor;
    PathMemoTest() {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        glue.knownHashes = nullptr;
        glue.checksumFlags = 0;
        glue.reserved = 0;
        glue.cacheRemoteDrives = false;
        cache.reset(new FS_Cache(L"dirs", L"files", widen(dir.path()).c_str(), false, true, &glue, L"prov"));
        EXPECT_EQ(0, cache->create(0, FS_CACHE_CREATE));
        cursor = cache->tbDirectories->openRecordSet();
    }
    ~PathMemoTest() override { cache->close(); }
    void addDir(unsigned int id, const std::wstring& name, unsigned int parent) {
        RecordSet rs = cache->tbDirectories->openRecordSet();
        rs.setFieldAsInt32(L"ID", id);
        rs.setFieldAsString(L"PATHNAME", name.c_str());
        rs.setFieldAsInt32(L"PARENTID", parent);
        rs.setFieldAsInt32(L"CREATIONTIME", 1);
        ASSERT_TRUE(rs.insert());
        cache->tbDirectories->closeRecordSet(rs);
    }
    void removeAllDirs() {
        RecordSet rs = cache->tbDirectories->openRecordSet();
        for (bool row = rs.moveFirst(); row; row = rs.moveNext()) rs.remove();
        cache->tbDirectories->closeRecordSet(rs);
    }
    std::wstring byId(unsigned int id) {
        std::vector<wchar_t> buffer(4097, L'#');
        if (!cache->findPathById(cursor, id, buffer.data(), 4096)) return L"<false>";
        return buffer.data();
    }
    bool memoHolds(unsigned int id) { return cache->pathMemo.count(static_cast<int>(id)) == 1; }
};

// "/" (1), then d2 under it, d3 under d2, ... d<depth+1>.
std::wstring chainPath(unsigned int last) {
    std::wstring path = L"/";
    for (unsigned int id = 2; id <= last; ++id) path += (id > 2 ? L"/d" : L"d") + std::to_wstring(id);
    return path;
}

}  // namespace

TEST_F(PathMemoTest, DeepChainResolvesEveryLevelAndKeepsItsAncestorsPastTheBound)
{
    const unsigned int depth = 200;  // far more levels than the memo's bound
    addDir(1, L"/", 0);
    for (unsigned int id = 2; id <= depth + 1; ++id) addDir(id, L"d" + std::to_wstring(id), id - 1);
    for (unsigned int id = 1; id <= depth + 1; ++id) ASSERT_EQ(chainPath(id), byId(id)) << id;

    // Forty directories under the deepest one, each a new lookup that
    // overflows the bound: the chain above them stays.
    for (unsigned int k = 0; k < 40; ++k) addDir(1000 + k, L"leaf" + std::to_wstring(k), depth + 1);
    for (unsigned int k = 0; k < 40; ++k)
        ASSERT_EQ(chainPath(depth + 1) + L"/leaf" + std::to_wstring(k), byId(1000 + k));
    for (unsigned int id = 1; id <= depth + 1; ++id) EXPECT_TRUE(memoHolds(id)) << id;
    EXPECT_LE(cache->pathMemo.size(), depth + 1 + cachetables::MEMO_ENTRIES + 1);

    // With the rows gone, one more leaf still resolves: its ancestors come
    // from the memo alone.
    removeAllDirs();
    addDir(2000, L"last", depth + 1);
    EXPECT_EQ(chainPath(depth + 1) + L"/last", byId(2000));
}

TEST_F(PathMemoTest, WideDirectoryResolvesEveryChildWithABoundedMemo)
{
    addDir(1, L"/", 0);
    addDir(2, L"wide", 1);
    const unsigned int children = 500;
    for (unsigned int k = 0; k < children; ++k) addDir(10 + k, L"c" + std::to_wstring(k), 2);
    size_t largest = 0;
    for (unsigned int k = 0; k < children; ++k) {
        ASSERT_EQ(L"/wide/c" + std::to_wstring(k), byId(10 + k));
        if (cache->pathMemo.size() > largest) largest = cache->pathMemo.size();
        // The parent and the root are never dropped while their children
        // are resolved.
        ASSERT_TRUE(memoHolds(1) && memoHolds(2)) << k;
    }
    EXPECT_LE(largest, cachetables::MEMO_ENTRIES + 1u);
    removeAllDirs();
    addDir(9999, L"late", 2);
    EXPECT_EQ(L"/wide/late", byId(9999));
}

TEST_F(PathMemoTest, MemoTextsHoldTheNamesWhole)
{
    addDir(1, L"/", 0);
    std::wstring longName(3000, L'x');
    addDir(2, longName, 1);
    addDir(3, L"\u00e9t\u00e9", 2);
    EXPECT_EQ(L"/" + longName + L"/\u00e9t\u00e9", byId(3));
    ASSERT_TRUE(memoHolds(2));
    EXPECT_EQ(longName, std::wstring(cache->pathMemo[2].text));
    EXPECT_EQ(2u, cache->pathMemo[3].parentId);
}

TEST_F(PathMemoTest, ABrokenChainStillFailsAfterTheBoundDropsEntries)
{
    addDir(1, L"/", 0);
    for (unsigned int k = 0; k < 40; ++k) addDir(10 + k, L"c" + std::to_wstring(k), 1);
    for (unsigned int k = 0; k < 40; ++k) ASSERT_EQ(L"/c" + std::to_wstring(k), byId(10 + k));
    addDir(100, L"orphan", 77);  // 77 does not exist
    EXPECT_EQ(L"<false>", byId(100));
}
