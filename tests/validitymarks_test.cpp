#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/sync.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

class TestCache : public FS_CacheBase {
public:
    TestCache(wchar_t const* dir, FsGlue* glue)
        : FS_CacheBase(L"dirs", L"files", dir, false, false, glue, L"provA") {}
    bool isFileToBeCached(FsQuery const&, wchar_t const*) override { return true; }
    void saveOrRestoreFilesOrMasksForCaching(FsQuery const&) override {}
};

using testsupport::widen;

std::string md5Text(const std::string& bytes)
{
    md5_context ctx;
    md5_init(&ctx);
    md5_update(&ctx, bytes.data(), bytes.size());
    unsigned char d[16];
    md5_final(&ctx, d);
    char text[MD5_TEXT_SIZE];
    md5_tostr(d, text);
    return text;
}

std::string md5Raw(const std::string& bytes)
{
    md5_context ctx;
    md5_init(&ctx);
    md5_update(&ctx, bytes.data(), bytes.size());
    unsigned char d[16];
    md5_final(&ctx, d);
    return std::string(reinterpret_cast<char*>(d), 16);
}

std::string record(const std::string& key, const std::string& digest)
{
    uint32_t len = static_cast<uint32_t>(key.size());
    return std::string(reinterpret_cast<char*>(&len), 4) + key + digest;
}

struct Fixture : ::testing::Test {
    testsupport::TempDir locks;
    testsupport::TempDir dir;
    FsGlue glue;
    std::wstring wdir;
    Fixture() : wdir(widen(dir.path())) {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        glue = testsupport::plainGlue();
    }
};

}  // namespace

TEST(ExcludeMD5Test, ConstructorZeroesEverythingAndUpdateSetsValid)
{
    ExcludeMD5 e;
    EXPECT_EQ(0u, e.valid);
    EXPECT_EQ(0u, e.word);
    unsigned int zero[4] = {0, 0, 0, 0};
    EXPECT_TRUE(e.compare(&zero));
    unsigned int d[4] = {1, 2, 3, 4};
    e.update("ignored", &d);
    EXPECT_EQ(1u, e.valid);
    EXPECT_TRUE(e.name.empty());
    EXPECT_TRUE(e.compare(&d));
    EXPECT_FALSE(e.compare(&zero));
    e.clear();
    EXPECT_EQ(0u, e.valid);
    EXPECT_TRUE(e.compare(&zero));
}

TEST(FsGlueTest, ConstructorSetsOnlyTail)
{
    FsGlue g;
    EXPECT_EQ(0u, g.tail);
}

TEST_F(Fixture, PathsDigestOfThreeByteTextRepeatsItBeforeMarker)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> inc{PathInfo(L"abc", false)}, exc;
    std::string r;
    c.getMd5OfPaths(inc, exc, r);
    EXPECT_EQ(md5Text("abcabc**BREA"), r);
}

TEST_F(Fixture, PathsDigestWithNoPathsIsTheMarkerAlone)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> inc, exc;
    std::string r;
    c.getMd5OfPaths(inc, exc, r);
    EXPECT_EQ(md5Text("**BREAK**"), r);
}

TEST_F(Fixture, PathsDigestFeedsExcludesAfterMarker)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> inc{PathInfo(L"/home/user", true), PathInfo(L"/a", false)};
    std::vector<PathInfo> exc{PathInfo(L"/x", false), PathInfo(L"/yy", true)};
    std::string r;
    c.getMd5OfPaths(inc, exc, r);
    EXPECT_EQ(md5Text("/home/user" "/a" "/a**BREAK" "/x" "/yy"), r);
}

TEST_F(Fixture, PathsDigestOfLongLastPathFeedsItsFirstNineBytes)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> inc{PathInfo(L"/abcdefghijkl", false)}, exc;
    std::string r;
    c.getMd5OfPaths(inc, exc, r);
    EXPECT_EQ(md5Text("/abcdefghijkl/abcdefgh"), r);
}

TEST_F(Fixture, AllPrefixInAnyCaseGivesEmptyDigest)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> inc{PathInfo(L"/usr", true), PathInfo(L"$ALL::x", false)}, exc;
    std::string r = "preset";
    testsupport::TraceCapture cap;
    c.getMd5OfPaths(inc, exc, r);
    EXPECT_TRUE(r.empty());
    EXPECT_TRUE(cap.contains("FS_CacheBase::getMd5OfPaths - md5 returned: ''"));
    std::vector<PathInfo> inc2{PathInfo(L"$Remote::", false)};
    r = "x";
    c.getMd5OfPaths(inc2, exc, r);
    EXPECT_TRUE(r.empty());
    std::vector<PathInfo> inc3{PathInfo(L"$other::y", false)};
    r = "x";
    c.getMd5OfPaths(inc3, exc, r);
    EXPECT_TRUE(r.empty());
}

TEST_F(Fixture, SwappingPathsChangesDigestButRecursiveFlagDoesNot)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> exc;
    std::vector<PathInfo> ab{PathInfo(L"/a", false), PathInfo(L"/b", false)};
    std::vector<PathInfo> ba{PathInfo(L"/b", false), PathInfo(L"/a", false)};
    std::vector<PathInfo> abRec{PathInfo(L"/a", true), PathInfo(L"/b", true)};
    std::string r1, r2, r3;
    c.getMd5OfPaths(ab, exc, r1);
    c.getMd5OfPaths(ba, exc, r2);
    c.getMd5OfPaths(abRec, exc, r3);
    EXPECT_NE(r1, r2);
    EXPECT_EQ(r1, r3);
}

TEST_F(Fixture, RootWithNoExcludesWritesZeroDigestRecord)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> none;
    c.updateMd5OfExclude(none, L"/data");
    std::string bytes = testsupport::readFile(dir.file("ex_hash"));
    EXPECT_EQ(record("/data", std::string(16, '\0')), bytes);
}

TEST_F(Fixture, RootSlashHasEmptyKeyAndBackslashesBecomeSlashes)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> ex{PathInfo(L"\\x\\y", false), PathInfo(L"/z", false)};
    c.updateMd5OfExclude(ex, L"/");
    std::string bytes = testsupport::readFile(dir.file("ex_hash"));
    EXPECT_EQ(record("", md5Raw("/x/y/z")), bytes);
}

TEST_F(Fixture, TwoSpellingsOfARootShareOneKey)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> ex{PathInfo(L"/a/tmp", false)};
    c.updateMd5OfExclude(ex, L"/a");
    EXPECT_TRUE(c.compareMd5OfExclude(ex, L"/a/"));
    c.updateMd5OfExclude(ex, L"/a/");
    EXPECT_EQ(1u, c.excludeMd5.size());
    EXPECT_EQ(record("/a", md5Raw("/a/tmp")), testsupport::readFile(dir.file("ex_hash")));
}

TEST_F(Fixture, NewRootWithNoExcludesComparesEqualAndOthersDiffer)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> none, some{PathInfo(L"/n/x", false)};
    EXPECT_TRUE(c.compareMd5OfExclude(none, L"/new"));
    EXPECT_EQ(0u, c.excludeMd5[std::string("/new")].valid);
    EXPECT_FALSE(c.compareMd5OfExclude(some, L"/n"));
    c.updateMd5OfExclude(some, L"/n");
    EXPECT_TRUE(c.compareMd5OfExclude(some, L"/n"));
    EXPECT_FALSE(c.compareMd5OfExclude(none, L"/n"));
}

TEST_F(Fixture, OnlyValidEntriesAreWrittenInMapOrder)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> none;
    c.compareMd5OfExclude(none, L"/zzz");  // creates an invalid entry
    c.updateMd5OfExclude(none, L"/b");
    c.updateMd5OfExclude(none, L"/a");
    std::string z(16, '\0');
    EXPECT_EQ(record("/a", z) + record("/b", z), testsupport::readFile(dir.file("ex_hash")));
}

TEST_F(Fixture, ReadRestoresRecordsAsValid)
{
    dir.write("ex_hash", record("/a", md5Raw("/a/tmp")) + record("", std::string(16, '\0')));
    TestCache c(wdir.c_str(), &glue);
    c.readMd5OfExclude();
    ASSERT_EQ(2u, c.excludeMd5.size());
    EXPECT_EQ(1u, c.excludeMd5[std::string("")].valid);
    std::vector<PathInfo> ex{PathInfo(L"/a/tmp", false)};
    EXPECT_TRUE(c.compareMd5OfExclude(ex, L"/a"));
}

TEST_F(Fixture, ExHashCutInMidRecordKeepsCompleteRecords)
{
    std::string full = record("/a", md5Raw("1")) + record("/bb", md5Raw("2"));
    dir.write("ex_hash", full.substr(0, full.size() - 5));
    TestCache c(wdir.c_str(), &glue);
    c.readMd5OfExclude();
    EXPECT_EQ(1u, c.excludeMd5.size());
    EXPECT_EQ(1u, c.excludeMd5.count("/a"));
}

TEST_F(Fixture, ExHashCutInsideLengthOrKeyKeepsEarlierRecords)
{
    std::string first = record("/a", md5Raw("1"));
    dir.write("ex_hash", first + std::string("\x03\x00", 2));
    TestCache c(wdir.c_str(), &glue);
    c.readMd5OfExclude();
    EXPECT_EQ(1u, c.excludeMd5.size());
    dir.write("ex_hash", first + record("/long", "").substr(0, 6));
    TestCache c2(wdir.c_str(), &glue);
    c2.readMd5OfExclude();
    EXPECT_EQ(1u, c2.excludeMd5.size());
}

TEST_F(Fixture, ExHashRecordLongerThan4095StopsReadingCleanly)
{
    uint32_t huge = 4096;
    std::string bad(reinterpret_cast<char*>(&huge), 4);
    bad += std::string(5000, 'k');
    dir.write("ex_hash", record("/a", md5Raw("1")) + bad + record("/b", md5Raw("2")));
    TestCache c(wdir.c_str(), &glue);
    testsupport::TraceCapture cap;
    c.readMd5OfExclude();
    EXPECT_EQ(1u, c.excludeMd5.size());
    EXPECT_EQ(1u, c.excludeMd5.count("/a"));
}

TEST_F(Fixture, MissingExHashLeavesMapEmpty)
{
    TestCache c(wdir.c_str(), &glue);
    c.readMd5OfExclude();
    EXPECT_TRUE(c.excludeMd5.empty());
}

TEST_F(Fixture, RemoveUnlinksFileButKeepsMap)
{
    TestCache c(wdir.c_str(), &glue);
    std::vector<PathInfo> none;
    c.updateMd5OfExclude(none, L"/a");
    ASSERT_TRUE(testsupport::fileExists(dir.file("ex_hash")));
    c.removeMd5FromExcludes();
    EXPECT_FALSE(testsupport::fileExists(dir.file("ex_hash")));
    EXPECT_EQ(1u, c.excludeMd5.size());
}

TEST_F(Fixture, UnwritableDirectoryWriteIsSilent)
{
    std::wstring missing = wdir + L"/no/such/dir";
    TestCache c(missing.c_str(), &glue);
    std::vector<PathInfo> none;
    c.updateMd5OfExclude(none, L"/a");
    EXPECT_EQ(1u, c.excludeMd5.size());
    EXPECT_FALSE(c.providerHash.updateMd5OfProvider());
    EXPECT_FALSE(c.providerHash.readMd5OfProvider());
}

TEST_F(Fixture, ProviderMarkIsRawMd5OfName)
{
    ProviderHash p(L"myProvider");
    ASSERT_TRUE(p.setCachePath(wdir.c_str()));
    EXPECT_EQ(wdir + L"/pr_hash", std::wstring(p.fileName));
    ASSERT_TRUE(p.updateMd5OfProvider());
    EXPECT_EQ(md5Raw("myProvider"), testsupport::readFile(dir.file("pr_hash")));
}

TEST_F(Fixture, MissingProviderMarkFailsRead)
{
    ProviderHash p(L"x");
    EXPECT_FALSE(p.readMd5OfProvider());  // no fileName
    EXPECT_FALSE(p.writeMd5File());
    ASSERT_TRUE(p.setCachePath(wdir.c_str()));
    EXPECT_FALSE(p.readMd5OfProvider());  // no file
    dir.write("pr_hash", "short");
    EXPECT_FALSE(p.readMd5OfProvider());
}

TEST_F(Fixture, ProviderChangeFailsOnceThenPasses)
{
    {
        ProviderHash old(L"oldProvider");
        old.setCachePath(wdir.c_str());
        ASSERT_TRUE(old.updateMd5OfProvider());
    }
    ProviderHash p(L"newProvider");
    p.setCachePath(wdir.c_str());
    ASSERT_TRUE(p.readMd5OfProvider());
    EXPECT_FALSE(p.compareMd5OfProvider(L"newProvider"));
    EXPECT_TRUE(p.compareMd5OfProvider(L"oldProvider"));  // compare leaves the digest alone
    ASSERT_TRUE(p.updateMd5OfProvider());
    ProviderHash next(L"newProvider");
    next.setCachePath(wdir.c_str());
    ASSERT_TRUE(next.readMd5OfProvider());
    EXPECT_TRUE(next.compareMd5OfProvider(L"newProvider"));
}

TEST(CacheFileNameTest, AddsSeparatorOnlyWhenMissing)
{
    wchar_t* a = FS_CacheBase::getCacheFileName(L"/c", L"dirs", L".counter");
    wchar_t* b = FS_CacheBase::getCacheFileName(L"/c/", L"dirs", L".cuflag");
    EXPECT_EQ(std::wstring(L"/c/dirs.counter"), a);
    EXPECT_EQ(std::wstring(L"/c/dirs.cuflag"), b);
    EXPECT_EQ(nullptr, FS_CacheBase::getCacheFileName(nullptr, L"d", L""));
    EXPECT_EQ(nullptr, FS_CacheBase::getCacheFileName(L"/c", L"d", nullptr));
    delete[] a;
    delete[] b;
}
