#include "fscanner/fscommon/sysfile.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/sysfactory.h"
#include "support/testsupport.h"

namespace {

long long diskSize(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) return -1;
    return static_cast<long long>(st.st_size);
}

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

// ---- codec ------------------------------------------------------------------

TEST(CodecTest, CompressedIntegersUseSevenBitGroupsWithLowContinuationBit) {
    std::string out;
    codec::putCompressed(&out, 0);
    EXPECT_EQ(std::string("\x00", 1), out);
    out.clear();
    codec::putCompressed(&out, 1);
    EXPECT_EQ("\x02", out);
    out.clear();
    codec::putCompressed(&out, 127);
    EXPECT_EQ("\xFE", out);
    out.clear();
    codec::putCompressed(&out, 128);
    EXPECT_EQ(std::string("\x03\x00", 2), out);
    out.clear();
    codec::putCompressed(&out, 300);
    EXPECT_EQ("\x05\x58", out);
    out.clear();
    codec::putCompressed(&out, 0xFFFFFFFFFFFFFFFFull);
    EXPECT_EQ(10u, out.size());
    uint64_t v = 0;
    EXPECT_EQ(10, codec::decodeCompressed(out.data(), out.size(), &v));
    EXPECT_EQ(0xFFFFFFFFFFFFFFFFull, v);
}

TEST(CodecTest, CompressedDecodeStopsAtTheWindowEnd) {
    const char unfinished[] = {'\x03', '\x03'};
    uint64_t v = 0;
    EXPECT_EQ(0, codec::decodeCompressed(unfinished, 2, &v));
    codec::ByteReader r(unfinished, 2);
    EXPECT_FALSE(r.getCompressed(&v));
    EXPECT_EQ(0u, r.position());
}

TEST(CodecTest, BigEndianAndHostOrderWords) {
    std::string out;
    codec::putBig32(&out, 0x01020304u);
    codec::putBig64(&out, 0x0102030405060708ull);
    EXPECT_EQ("\x01\x02\x03\x04\x01\x02\x03\x04\x05\x06\x07\x08", out);
    codec::ByteReader r(out.data(), out.size());
    uint32_t a;
    uint64_t b;
    ASSERT_TRUE(r.getBig32(&a));
    ASSERT_TRUE(r.getBig64(&b));
    EXPECT_EQ(0x01020304u, a);
    EXPECT_EQ(0x0102030405060708ull, b);
    EXPECT_FALSE(r.getFixed32(&a));

    std::string host;
    codec::putFixed32(&host, 0x11223344u);
    uint32_t expected = 0x11223344u;
    EXPECT_EQ(0, std::memcmp(host.data(), &expected, 4));
}

TEST(CodecTest, LengthPrefixedForms) {
    std::string out;
    codec::putPrefixedBig32Plus1(&out, "", 0);
    EXPECT_EQ(std::string("\x00\x00\x00\x01", 4), out);
    out.clear();
    codec::putPrefixedCompressed(&out, "ab", 2);
    EXPECT_EQ("\x04" "ab", out);
    out.clear();
    codec::putPrefixed16(&out, "xyz", 3);
    ASSERT_EQ(5u, out.size());
    EXPECT_EQ(3, codec::decodeFixed16(out.data()));
}

// ---- SysFactory -------------------------------------------------------------

TEST(SysFactoryTest, NullNamesGiveNull) {
    EXPECT_EQ(nullptr, SysFactory::createStdFile(nullptr));
    EXPECT_EQ(nullptr, SysFactory::createMmFile(nullptr));
    EXPECT_EQ(nullptr, SysFactory::createMutex(nullptr));
    EXPECT_EQ(nullptr, SysFactory::createSemaphore(nullptr));
}

TEST(SysFactoryTest, ThreadsAreNotProvided) {
    EXPECT_EQ(nullptr, SysFactory::createThread(nullptr));
    EXPECT_EQ(nullptr, SysFactory::createThread(nullptr, 1000));
}

TEST(SysFactoryTest, FactoryMakesTheLinuxKindsAndTouchesNoFile) {
    testsupport::TempDir dir;
    std::string path = dir.file("made.bin");
    AbstractMmFile* mm = SysFactory::createMmFile(wide(path).c_str());
    ASSERT_NE(nullptr, mm);
    EXPECT_NE(nullptr, dynamic_cast<LinuxMmFile*>(mm));
    EXPECT_FALSE(testsupport::fileExists(path));
    delete mm;
    AbstractStdFile* sf = SysFactory::createStdFile(wide(path).c_str());
    ASSERT_NE(nullptr, sf);
    EXPECT_NE(nullptr, dynamic_cast<StdFile*>(sf));
    EXPECT_FALSE(testsupport::fileExists(path));
    delete sf;

    char saved[1024];
    std::memcpy(saved, LinuxSharedMutex::storePath, sizeof saved);
    ASSERT_TRUE(LinuxSharedMutex::setStorePath(dir.path().c_str()));
    AbstractMutex* m = SysFactory::createMutex(L"factory_lock");
    ASSERT_NE(nullptr, m);
    EXPECT_NE(nullptr, dynamic_cast<LinuxSharedMutex*>(m));
    EXPECT_TRUE(testsupport::fileExists(dir.file("factory_lock")));
    delete m;
    std::memcpy(LinuxSharedMutex::storePath, saved, sizeof saved);

    AbstractSemaphore* s = SysFactory::createSemaphore(L"factory_sem");
    ASSERT_NE(nullptr, s);
    EXPECT_NE(nullptr, dynamic_cast<LinuxSemaphore*>(s));
    delete s;
}

TEST(SysFactoryTest, SleepWaitsTheGivenMilliseconds) {
    auto start = std::chrono::steady_clock::now();
    SysFactory::sleep(30);
    auto ms = std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start).count();
    EXPECT_GE(ms, 30);
}

// ---- StdFile ----------------------------------------------------------------

TEST(StdFileTest, WithoutANameCreateAndOpenFail) {
    StdFile f(nullptr);
    EXPECT_FALSE(f.create());
    EXPECT_FALSE(f.open());
    EXPECT_FALSE(f.close());
    EXPECT_FALSE(f.seek(0, 1));
    unsigned int size = 0;
    EXPECT_FALSE(f.size(&size));
}

TEST(StdFileTest, WriteSeekReadAndSize) {
    testsupport::TempDir dir;
    std::string path = dir.file("std.bin");
    StdFile f(wide(path).c_str());
    EXPECT_FALSE(f.open());  // missing file: "r+b" fails
    ASSERT_TRUE(f.create());
    char data[] = "hello world";
    EXPECT_EQ(11u, f.write(data, 11));
    unsigned int size = 0;
    ASSERT_TRUE(f.size(&size));
    EXPECT_EQ(11u, size);
    EXPECT_EQ(11, f.tell());  // size() restores the position
    EXPECT_TRUE(f.seek(6, 1));
    char out[16] = {0};
    EXPECT_EQ(5u, f.read(out, 5));
    EXPECT_STREQ("world", out);
    EXPECT_TRUE(f.seek(-5, 3));
    EXPECT_EQ(6, f.tell());
    EXPECT_TRUE(f.seek(-1, 2));
    EXPECT_EQ(5, f.tell());
    EXPECT_FALSE(f.seek(0, 0));
    EXPECT_FALSE(f.seek(0, 4));
    EXPECT_TRUE(f.seek(0, 3));
    EXPECT_EQ(0u, f.read(out, 1));
    EXPECT_TRUE(f.eof());
    EXPECT_TRUE(f.close());
    EXPECT_FALSE(f.close());
    ASSERT_TRUE(f.open());
    EXPECT_EQ(11u, f.read(out, 11));
    EXPECT_EQ(std::string("hello world"), std::string(out, 11));
}

TEST(StdFileTest, SeekReportsTrueWhateverFseekSays) {
    testsupport::TempDir dir;
    StdFile f(wide(dir.file("s.bin")).c_str());
    ASSERT_TRUE(f.create());
    EXPECT_TRUE(f.seek(-100, 1));  // fseek refuses a negative target; the result stays true
}

// ---- LinuxMmFile ------------------------------------------------------------

TEST(LinuxMmFileTest, OneByteWriteExtendsToAChunkAndCloseTruncates) {
    testsupport::TempDir dir;
    std::string path = dir.file("one.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    EXPECT_EQ(0, diskSize(path));
    char b = 'x';
    EXPECT_EQ(1u, f.write(&b, 1));
    EXPECT_EQ(0x1000000, diskSize(path));
    EXPECT_EQ(1u, f.logicalSize());
    EXPECT_EQ(0x1000000u, f.allocatedSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(1, diskSize(path));
    EXPECT_EQ("x", testsupport::readFile(path));
}

TEST(LinuxMmFileTest, WriteOfAWholeChunkAllocatesTwoChunks) {
    testsupport::TempDir dir;
    std::string path = dir.file("big.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::vector<char> data(0x1000000, 'a');
    EXPECT_EQ(0x1000000u, f.write(data.data(), 0x1000000));
    EXPECT_EQ(0x2000000, diskSize(path));
    EXPECT_EQ(0x1000000u, f.logicalSize());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(0x1000000, diskSize(path));
}

TEST(LinuxMmFileTest, ReadOnNewUnmappedFileReturnsZeroAndSetsEofUntilSeek) {
    testsupport::TempDir dir;
    LinuxMmFile f(dir.file("empty.bin").c_str());
    ASSERT_TRUE(f.create());
    char buf[4];
    EXPECT_EQ(0u, f.read(buf, 4));
    EXPECT_TRUE(f.eof());
    EXPECT_TRUE(f.seek(0, 1));
    EXPECT_FALSE(f.eof());
    // Even a refused seek clears the flag.
    f.read(buf, 4);
    EXPECT_TRUE(f.eof());
    EXPECT_FALSE(f.seek(5, 1));
    EXPECT_FALSE(f.eof());
}

TEST(LinuxMmFileTest, ShortReadSetsEofAndZeroByteReadAtEndClearsIt) {
    testsupport::TempDir dir;
    LinuxMmFile f(dir.file("r.bin").c_str());
    ASSERT_TRUE(f.create());
    char data[] = "abcdef";
    ASSERT_EQ(6u, f.write(data, 6));
    ASSERT_TRUE(f.seek(2, 1));
    char out[16] = {0};
    EXPECT_EQ(4u, f.read(out, 10));
    EXPECT_EQ(std::string("cdef"), std::string(out, 4));
    EXPECT_TRUE(f.eof());
    EXPECT_EQ(6, f.tell());
    EXPECT_EQ(0u, f.read(out, 0));
    EXPECT_FALSE(f.eof());
    ASSERT_TRUE(f.seek(0, 1));
    EXPECT_EQ(3u, f.read(out, 3));
    EXPECT_FALSE(f.eof());
    EXPECT_EQ(3, f.tell());
}

TEST(LinuxMmFileTest, SeekFromEndAcceptsOnlyZeroOrBelow) {
    testsupport::TempDir dir;
    LinuxMmFile f(dir.file("s.bin").c_str());
    ASSERT_TRUE(f.create());
    char data[] = "0123456789";
    ASSERT_EQ(10u, f.write(data, 10));
    EXPECT_FALSE(f.seek(1, 3));
    EXPECT_EQ(10, f.tell());
    EXPECT_TRUE(f.seek(0, 3));
    EXPECT_EQ(10, f.tell());
    EXPECT_TRUE(f.seek(-1, 3));
    EXPECT_EQ(9, f.tell());
    EXPECT_FALSE(f.seek(-11, 3));
    EXPECT_EQ(9, f.tell());
}

TEST(LinuxMmFileTest, SeekRefusesTargetsOutsideTheContent) {
    testsupport::TempDir dir;
    LinuxMmFile f(dir.file("s2.bin").c_str());
    ASSERT_TRUE(f.create());
    char data[] = "0123456789";
    ASSERT_EQ(10u, f.write(data, 10));
    EXPECT_FALSE(f.seek(-1, 1));
    EXPECT_FALSE(f.seek(11, 1));
    EXPECT_TRUE(f.seek(10, 1));
    EXPECT_TRUE(f.seek(4, 1));
    EXPECT_TRUE(f.seek(-4, 2));
    EXPECT_EQ(0, f.tell());
    EXPECT_FALSE(f.seek(-1, 2));
    EXPECT_FALSE(f.seek(11, 2));
    EXPECT_FALSE(f.seek(0, 0));
    EXPECT_FALSE(f.seek(0, 4));
    EXPECT_EQ(0, f.tell());
}

TEST(LinuxMmFileTest, CreateOnAnExistingNameReplacesTheFile) {
    testsupport::TempDir dir;
    std::string path = dir.write("old.bin", "old contents");
    struct stat before;
    ASSERT_EQ(0, stat(path.c_str(), &before));
    // Keep the old inode alive so that a new file cannot reuse its number.
    FILE* keep = fopen(path.c_str(), "rb");
    ASSERT_NE(nullptr, keep);
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    struct stat after;
    ASSERT_EQ(0, stat(path.c_str(), &after));
    EXPECT_NE(before.st_ino, after.st_ino);
    EXPECT_EQ(0, after.st_size);
    EXPECT_TRUE(f.close());
    EXPECT_EQ("", testsupport::readFile(path));
    fclose(keep);
}

TEST(LinuxMmFileTest, OpenOfMissingFileFailsAndSecondOpenKeepsTheFirst) {
    testsupport::TempDir dir;
    LinuxMmFile missing(dir.file("missing.bin").c_str());
    EXPECT_FALSE(missing.open());
    EXPECT_FALSE(missing.isOpen());

    std::string path = dir.write("data.bin", "payload");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.open());
    EXPECT_FALSE(f.open());
    EXPECT_FALSE(f.create());
    EXPECT_TRUE(f.isOpen());
    char out[8] = {0};
    EXPECT_EQ(7u, f.read(out, 7));
    EXPECT_EQ(std::string("payload"), std::string(out, 7));
    EXPECT_TRUE(f.close());
    EXPECT_FALSE(f.close());
}

TEST(LinuxMmFileTest, OpenOfAnEmptyFileStaysUnmappedUntilTheFirstWrite) {
    testsupport::TempDir dir;
    std::string path = dir.write("empty.bin", "");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.open());
    char c;
    EXPECT_EQ(0u, f.read(&c, 1));
    EXPECT_TRUE(f.eof());
    char data[] = "zz";
    EXPECT_EQ(2u, f.write(data, 2));
    EXPECT_TRUE(f.close());
    EXPECT_EQ("zz", testsupport::readFile(path));
}

TEST(LinuxMmFileTest, SizeReportsTheAllocatedSizeOnDiskWhileOpen) {
    testsupport::TempDir dir;
    std::string path = dir.file("sz.bin");
    LinuxMmFile f(path.c_str());
    unsigned int size = 77;
    EXPECT_FALSE(f.size(&size));  // no descriptor
    ASSERT_TRUE(f.create());
    char data[] = "abc";
    ASSERT_EQ(3u, f.write(data, 3));
    ASSERT_TRUE(f.size(&size));
    EXPECT_EQ(0x1000000u, size);
    EXPECT_EQ(3u, f.logicalSize());
}

TEST(LinuxMmFileTest, WritesInsideTheAllocationSetLogicalSizeToPositionPlusLength) {
    testsupport::TempDir dir;
    std::string path = dir.file("grow.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    char data[] = "0123456789";
    ASSERT_EQ(10u, f.write(data, 10));
    ASSERT_TRUE(f.seek(8, 1));
    ASSERT_EQ(4u, f.write(data, 4));  // straddles the end inside the allocation
    EXPECT_EQ(12u, f.logicalSize());
    EXPECT_EQ(12, f.tell());
    EXPECT_TRUE(f.close());
    EXPECT_EQ("012345670123", testsupport::readFile(path));
}

TEST(LinuxMmFileTest, StraddlingWriteThatGrowsAddsTheWholeLengthToTheLogicalSize) {
    testsupport::TempDir dir;
    std::string path = dir.file("straddle.bin");
    // A file of 10 bytes on disk: opening makes allocated == logical == 10.
    dir.write("straddle.bin", "0123456789");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.open());
    ASSERT_EQ(10u, f.allocatedSize());
    ASSERT_TRUE(f.seek(8, 1));
    char data[] = "ABCD";
    ASSERT_EQ(4u, f.write(data, 4));
    // Growth adds the length to the OLD logical size: 10 + 4, not 8 + 4.
    EXPECT_EQ(14u, f.logicalSize());
    EXPECT_EQ(10u + 0x1000000u, f.allocatedSize());
    EXPECT_EQ(12, f.tell());
    EXPECT_TRUE(f.close());
    EXPECT_EQ(std::string("01234567ABCD\0\0", 14), testsupport::readFile(path));
}

TEST(LinuxMmFileTest, ContentSurvivesCloseAndReopen) {
    testsupport::TempDir dir;
    std::string path = dir.file("reopen.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::string text = "first session";
    ASSERT_EQ(text.size(), f.write(&text[0], static_cast<unsigned int>(text.size())));
    ASSERT_TRUE(f.close());
    ASSERT_TRUE(f.open());
    EXPECT_EQ(text.size(), f.logicalSize());
    ASSERT_TRUE(f.seek(0, 3));
    std::string more = "+more";
    ASSERT_EQ(5u, f.write(&more[0], 5));
    ASSERT_TRUE(f.close());
    EXPECT_EQ("first session+more", testsupport::readFile(path));
}

TEST(LinuxMmFileTest, NamelessFileRefusesEverything) {
    LinuxMmFile f(nullptr);
    EXPECT_FALSE(f.create());
    EXPECT_FALSE(f.open());
    EXPECT_FALSE(f.close());
    char c = 0;
    EXPECT_EQ(0u, f.read(&c, 1));
    EXPECT_EQ(0u, f.write(&c, 1));
}

}  // namespace
