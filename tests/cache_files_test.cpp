// The files of a cache directory: their names, and the side files written,
// read back and read when damaged.
#include "fscanner/fscommon/cache_files.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "base/kelmem.h"
#include "support/error_env.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::readFile;

namespace {

// A name from the unit as a std::wstring; frees the block.
std::wstring kelmName(wchar_t* name) {
    std::wstring out = name != nullptr ? name : L"<null>";
    kelm_free(name);
    return out;
}

std::wstring newName(wchar_t* name) {
    std::wstring out = name != nullptr ? name : L"<null>";
    delete[] name;
    return out;
}

std::string word(uint32_t value) { return std::string(reinterpret_cast<char const*>(&value), 4); }

TEST(CacheFileNames, TableFilesIndexesLocksAndCompactionCopies) {
    EXPECT_EQ(L"files.dat", kelmName(cachefiles::tableDataName(L"files")));
    EXPECT_EQ(L"/c/files.pxx", kelmName(cachefiles::tablePointerPath(L"/c/", L"files")));
    EXPECT_EQ(L"files_idx.dat", kelmName(cachefiles::tableIndexListName(L"files")));
    EXPECT_EQ(L"files_t_mutex", kelmName(cachefiles::tableLockName(L"files")));
    EXPECT_EQ(L"byName.idx", kelmName(cachefiles::indexFileName(L"byName")));
    EXPECT_EQ(L"files_cpt", kelmName(cachefiles::compactionName(L"files")));
    EXPECT_EQ(L"<null>", kelmName(cachefiles::tableDataName(nullptr)));
}

TEST(CacheFileNames, SideFilesOfTheCacheDirectory) {
    EXPECT_EQ(L"/c/dirs.counter", newName(cachefiles::counterPath(L"/c", L"dirs")));
    EXPECT_EQ(L"/c/dirs.cuflag", newName(cachefiles::updateFlagPath(L"/c/", L"dirs")));
    EXPECT_EQ(L"/c/cat_set", newName(cachefiles::catalogSetPath(L"/c")));
    EXPECT_EQ(L"/c/ex_hash", newName(cachefiles::excludeDigestsPath(L"/c")));
    // The provider mark always takes a separator of its own.
    EXPECT_EQ(L"/c/pr_hash", kelmName(cachefiles::providerDigestPath(L"/c")));
    EXPECT_EQ(L"//pr_hash", kelmName(cachefiles::providerDigestPath(L"/")));
    EXPECT_EQ(L"<null>", newName(cachefiles::cacheFileName(L"/c", nullptr, L"")));
}

TEST(CacheFileNames, AccessMutexNameHasNoSeparatorsOrColons) {
    EXPECT_EQ(L"_var_cache_a_b_c_mutex", kelmName(cachefiles::accessMutexName(L"/var/cache/a:b")));
}

TEST(CacheFileNames, FolderLogLiesInTheTraceDirectory) {
    EXPECT_EQ("/tmp/t/traceKEL_scanned_dirs.log", cachefiles::folderLogPath("/tmp/t"));
    EXPECT_EQ("/traceKEL_scanned_dirs.log", cachefiles::folderLogPath(""));
    EXPECT_EQ("/traceKEL_scanned_dirs.log", cachefiles::folderLogPath(nullptr));
}

// ---- .counter

TEST(CounterFile, WritesFourHostOrderBytesAndReadsThemBack) {
    TempDir dir;
    std::string path = dir.file("dirs.counter");
    ASSERT_TRUE(cachefiles::writeCounter(path.c_str(), 0x12345678u));
    EXPECT_EQ(word(0x12345678u), readFile(path));
    uint32_t value = 0;
    ASSERT_TRUE(cachefiles::readCounter(path.c_str(), &value));
    EXPECT_EQ(0x12345678u, value);
}

TEST(CounterFile, ExistingCounterIsOverwrittenInPlaceAndCutToFourBytes) {
    TempDir dir;
    std::string path = dir.write("dirs.counter", word(7) + "trailing");
    struct stat before;
    ASSERT_EQ(0, stat(path.c_str(), &before));
    ASSERT_TRUE(cachefiles::writeCounter(path.c_str(), 9));
    struct stat after;
    ASSERT_EQ(0, stat(path.c_str(), &after));
    EXPECT_EQ(before.st_ino, after.st_ino);
    EXPECT_EQ(word(9), readFile(path));
}

TEST(CounterFile, MissingOrShortCounterIsNotRead) {
    TempDir dir;
    uint32_t value = 5;
    EXPECT_FALSE(cachefiles::readCounter(dir.file("none").c_str(), &value));
    std::string path = dir.write("short", "abc");
    EXPECT_FALSE(cachefiles::readCounter(path.c_str(), &value));
    EXPECT_EQ(5u, value);
}

// ---- .cuflag

TEST(UpdateFlag, MadeEmptyPresentUntilRemoved) {
    TempDir dir;
    std::string path = dir.write("dirs.cuflag", "left by a crash");
    EXPECT_TRUE(cachefiles::updateFlagPresent(path.c_str()));
    ASSERT_TRUE(cachefiles::createUpdateFlag(path.c_str()));
    EXPECT_EQ("", readFile(path));
    struct stat st;
    ASSERT_EQ(0, stat(path.c_str(), &st));
    EXPECT_EQ(0u, st.st_mode & 0117);  // 0660 at most
    EXPECT_TRUE(cachefiles::removeSideFile(path.c_str()));
    EXPECT_FALSE(cachefiles::updateFlagPresent(path.c_str()));
    EXPECT_FALSE(cachefiles::removeSideFile(path.c_str()));
}

// ---- pr_hash

TEST(ProviderMark, SixteenBytesRoundTripExactly) {
    TempDir dir;
    std::string path = dir.file("pr_hash");
    unsigned char digest[16];
    for (int i = 0; i < 16; ++i) digest[i] = static_cast<unsigned char>(0xA0 + i);
    ASSERT_TRUE(cachefiles::writeProviderDigest(path.c_str(), digest));
    EXPECT_EQ(std::string(reinterpret_cast<char*>(digest), 16), readFile(path));
    unsigned char back[16] = {0};
    bool exact = false;
    ASSERT_TRUE(cachefiles::readProviderDigest(path.c_str(), back, &exact));
    EXPECT_TRUE(exact);
    EXPECT_EQ(0, std::memcmp(digest, back, 16));
}

TEST(ProviderMark, LongerFileReadsItsFirstSixteenBytesButIsNotExact) {
    TempDir dir;
    std::string path = dir.write("pr_hash", "0123456789abcdefXYZ");
    unsigned char back[16];
    bool exact = true;
    ASSERT_TRUE(cachefiles::readProviderDigest(path.c_str(), back, &exact));
    EXPECT_FALSE(exact);
    EXPECT_EQ("0123456789abcdef", std::string(reinterpret_cast<char*>(back), 16));
}

TEST(ProviderMark, ShortOrMissingFileIsNoMark) {
    TempDir dir;
    unsigned char back[16];
    EXPECT_FALSE(cachefiles::readProviderDigest(dir.file("none").c_str(), back, nullptr));
    std::string path = dir.write("pr_hash", "short");
    EXPECT_FALSE(cachefiles::readProviderDigest(path.c_str(), back, nullptr));
}

// ---- ex_hash

std::vector<cachefiles::ExcludeDigest> twoRoots() {
    std::vector<cachefiles::ExcludeDigest> records(2);
    records[0].key = "";
    std::memset(records[0].digest, 0, 16);
    records[1].key = "/data";
    for (int i = 0; i < 16; ++i) records[1].digest[i] = static_cast<unsigned char>(i + 1);
    return records;
}

TEST(ExcludeMarks, RecordsAreLengthKeyDigestBackToBack) {
    TempDir dir;
    std::string path = dir.file("ex_hash");
    bool opened = false;
    ASSERT_TRUE(cachefiles::writeExcludeDigests(path.c_str(), twoRoots(), &opened));
    EXPECT_TRUE(opened);
    std::string expected = word(0) + std::string(16, '\0') + word(5) + "/data" +
                           "\x01\x02\x03\x04\x05\x06\x07\x08\x09\x0a\x0b\x0c\x0d\x0e\x0f\x10";
    EXPECT_EQ(expected, readFile(path));

    std::vector<cachefiles::ExcludeDigest> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readExcludeDigests(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::END_OF_FILE, end);
    ASSERT_EQ(2u, back.size());
    EXPECT_EQ("", back[0].key);
    EXPECT_EQ("/data", back[1].key);
    EXPECT_EQ(16, back[1].digest[15]);
}

TEST(ExcludeMarks, FileCutInARecordKeepsTheWholeRecordsBeforeIt) {
    TempDir dir;
    std::string path = dir.file("ex_hash");
    bool opened = false;
    ASSERT_TRUE(cachefiles::writeExcludeDigests(path.c_str(), twoRoots(), &opened));
    std::string whole = readFile(path);
    dir.write("ex_hash", whole.substr(0, whole.size() - 3));
    std::vector<cachefiles::ExcludeDigest> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readExcludeDigests(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::CUT_SHORT, end);
    ASSERT_EQ(1u, back.size());
    EXPECT_EQ("", back[0].key);
}

TEST(ExcludeMarks, LengthBeyondTheLimitStopsReadingAsDamage) {
    TempDir dir;
    std::string path = dir.write("ex_hash", word(1) + "/" + std::string(16, 'd') + word(4096) + "xxxx");
    std::vector<cachefiles::ExcludeDigest> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readExcludeDigests(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::DAMAGED_RECORD, end);
    EXPECT_EQ(4096u, damaged);
    ASSERT_EQ(1u, back.size());
    EXPECT_EQ("/", back[0].key);
}

TEST(ExcludeMarks, MissingFileIsNotRead) {
    TempDir dir;
    std::vector<cachefiles::ExcludeDigest> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    EXPECT_FALSE(cachefiles::readExcludeDigests(dir.file("ex_hash").c_str(), &back, &end, &damaged));
    EXPECT_TRUE(back.empty());
}

TEST(ExcludeMarks, FileThatCannotBeMadeIsReportedAsNotOpened) {
    TempDir dir;
    testsupport::ErrorEnv env;
    env.failPath(testsupport::EnvCall::OpenFile, "ex_hash", EACCES);
    testsupport::ScopedEnv installed(&env);
    bool opened = true;
    EXPECT_FALSE(cachefiles::writeExcludeDigests(dir.file("ex_hash").c_str(), twoRoots(), &opened));
    EXPECT_FALSE(opened);
    EXPECT_EQ(EACCES, errno);
    EXPECT_FALSE(testsupport::fileExists(dir.file("ex_hash")));
}

TEST(ExcludeMarks, FailedWriteIsReportedAsOpened) {
    TempDir dir;
    testsupport::ErrorEnv env;
    env.failPath(testsupport::EnvCall::WriteFile, "ex_hash", ENOSPC);
    testsupport::ScopedEnv installed(&env);
    bool opened = false;
    EXPECT_FALSE(cachefiles::writeExcludeDigests(dir.file("ex_hash").c_str(), twoRoots(), &opened));
    EXPECT_TRUE(opened);
    EXPECT_EQ(ENOSPC, errno);
}

// ---- cat_set

TEST(CatalogSet, RecordsAreCountAndWideCharactersBackToBack) {
    TempDir dir;
    std::string path = dir.file("cat_set");
    std::vector<std::wstring> records = {L"ab", L"", L"*.so"};
    bool opened = false;
    ASSERT_TRUE(cachefiles::writeCatalogSet(path.c_str(), records, &opened));
    EXPECT_EQ(word(2) + word('a') + word('b') + word(0) + word(4) + word('*') + word('.') + word('s') +
                  word('o'),
              readFile(path));
    std::vector<std::wstring> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readCatalogSet(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::END_OF_FILE, end);
    EXPECT_EQ(records, back);
}

TEST(CatalogSet, CountAboveTheBufferIsDamageAndEarlierRecordsStay) {
    TempDir dir;
    std::string path = dir.write("cat_set", word(1) + word('x') + word(4096) + word('y'));
    std::vector<std::wstring> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readCatalogSet(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::DAMAGED_RECORD, end);
    EXPECT_EQ(4096u, damaged);
    EXPECT_EQ(std::vector<std::wstring>{L"x"}, back);
}

TEST(CatalogSet, RecordOfTheLargestCountIsRead) {
    TempDir dir;
    std::string body = word(4095);
    for (int i = 0; i < 4095; ++i) body += word('z');
    std::string path = dir.write("cat_set", body + word(3) + word('a'));
    std::vector<std::wstring> back;
    cachefiles::ReadEnd end;
    uint32_t damaged = 0;
    ASSERT_TRUE(cachefiles::readCatalogSet(path.c_str(), &back, &end, &damaged));
    EXPECT_EQ(cachefiles::CUT_SHORT, end);
    ASSERT_EQ(1u, back.size());
    EXPECT_EQ(std::wstring(4095, L'z'), back[0]);
}

}  // namespace
