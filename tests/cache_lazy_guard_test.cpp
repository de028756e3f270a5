// A cache whose damage lies in rows a query does not read still answers that
// query; the first query that reads a damaged row answers -40, and close()
// removes the cache for a rebuild, as damage found at open does.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>
#include <string>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "support/cachefixture.h"

using testsupport::HitWriter;
using testsupport::widen;

namespace {

const unsigned int LONG_AGE = 3600 * 24;

struct CacheLazyGuardTest : ::testing::Test {
    testsupport::MachineFixture machine;
    testsupport::TempDir tree;
    testsupport::TempDir cache;
    std::string root;

    CacheLazyGuardTest() {
        root = tree.path();
        while (root.size() > 1 && root.back() == '/')
            root.pop_back();
        for (int d = 0; d < 3; ++d)
            for (int f = 0; f < 5; ++f)
                tree.write("dir" + std::to_string(d) + "/file" + std::to_string(f) + ".txt", "x");
        tree.write("dir1/needle.conf", "n");
        tree.write("dir2/haystack_straw.txt", "h");
    }

    int query(FS_Cache& c, const wchar_t* text, HitWriter* writer) {
        FsQuery q;
        q.setQuery(text);
        q.addIncludePath(widen(root).c_str(), true);
        return c.executeQueryEx(*writer, q, 600000, LONG_AGE);
    }

    void build() {
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        HitWriter writer;
        ASSERT_EQ(0, query(c, L"[SIZE]>=0", &writer));
        ASSERT_EQ(17u, writer.hits.size());
        c.close();
    }

    // Changes one letter of a stored file name in place: the record keeps
    // its shape, its key no longer hashes to the bucket it is filed under.
    void misspell(const std::string& name) {
        std::string path = cache.file("files.dat");
        std::string data = testsupport::readFile(path);
        size_t at = data.find(name);
        ASSERT_NE(std::string::npos, at);
        FILE* f = fopen(path.c_str(), "r+b");
        ASSERT_NE(nullptr, f);
        fseek(f, static_cast<long>(at), SEEK_SET);
        fputc('z', f);
        fclose(f);
    }
};

}  // namespace

TEST_F(CacheLazyGuardTest, ExactNameIsAnsweredWhileTheDamagedRowIsNotRead)
{
    build();
    misspell("haystack_straw.txt");
    testsupport::TraceCapture capture;
    FsGlue glue = testsupport::plainGlue();
    FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    HitWriter exact;
    EXPECT_EQ(0, query(c, L"[FILENAME]==\"needle.conf\"", &exact));
    ASSERT_EQ(1u, exact.hits.size());
    EXPECT_EQ(root + "/dir1/needle.conf", *exact.hits.begin());
    // The whole tree reads the damaged row: -40, latched, removed at close.
    HitWriter whole;
    EXPECT_EQ(CACHE_UNUSABLE, query(c, L"[SIZE]>=0", &whole));
    HitWriter after;
    EXPECT_EQ(CACHE_UNUSABLE, query(c, L"[FILENAME]==\"needle.conf\"", &after));
    c.close();
    EXPECT_FALSE(testsupport::fileExists(cache.file("files.dat")));
    EXPECT_TRUE(capture.contains("files_FILENAME.idx': record does not hold the key its index entry is filed under"))
        << capture.dump();
}

TEST_F(CacheLazyGuardTest, ExactNameOfTheDamagedRowAnswersUnusable)
{
    build();
    misspell("needle.conf");
    FsGlue glue = testsupport::plainGlue();
    {
        FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
        HitWriter exact;
        EXPECT_EQ(CACHE_UNUSABLE, query(c, L"[FILENAME]==\"needle.conf\"", &exact));
        EXPECT_TRUE(exact.hits.empty());
        c.close();
    }
    EXPECT_FALSE(testsupport::fileExists(cache.file("files.dat")));
    // The next query builds the cache anew and answers right.
    FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    HitWriter again;
    EXPECT_EQ(0, query(c, L"[FILENAME]==\"needle.conf\"", &again));
    ASSERT_EQ(1u, again.hits.size());
    EXPECT_EQ(root + "/dir1/needle.conf", *again.hits.begin());
    c.close();
}

TEST_F(CacheLazyGuardTest, ZeroedSlotIsFoundByTheWalkOverEveryRowNotByAnExactName)
{
    build();
    // The slot of the row of haystack_straw.txt reads as removed while the
    // stored count still counts it: only counting every slot tells.
    std::string data = testsupport::readFile(cache.file("files.dat"));
    size_t at = data.find("haystack_straw.txt");
    ASSERT_NE(std::string::npos, at);
    std::string pointers = testsupport::readFile(cache.file("files.pxx"));
    long slot = -1;
    uint32_t best = 0;
    for (size_t i = 0; i + 4 <= pointers.size(); i += 4) {
        uint32_t offset;
        memcpy(&offset, pointers.data() + i, 4);
        if (offset <= at && offset > best) {
            best = offset;
            slot = static_cast<long>(i);
        }
    }
    ASSERT_GE(slot, 0);
    FILE* f = fopen(cache.file("files.pxx").c_str(), "r+b");
    ASSERT_NE(nullptr, f);
    fseek(f, slot, SEEK_SET);
    uint32_t zero = 0;
    fwrite(&zero, 4, 1, f);
    fclose(f);

    testsupport::TraceCapture capture;
    FsGlue glue = testsupport::plainGlue();
    FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    HitWriter exact;
    EXPECT_EQ(0, query(c, L"[FILENAME]==\"needle.conf\"", &exact));
    EXPECT_EQ(1u, exact.hits.size());
    HitWriter whole;
    EXPECT_EQ(CACHE_UNUSABLE, query(c, L"[SIZE]>=0", &whole));
    c.close();
    EXPECT_FALSE(testsupport::fileExists(cache.file("files.dat")));
    EXPECT_TRUE(capture.contains("files.dat': stored count differs from the live slots of the pointer file"))
        << capture.dump();
}
