// Checksums: the digests against published vectors and the system's tools,
// the text and signature helpers, and the one-pass file reader with its read
// sizes, result codes and throttle calls.
#include "fscanner/fscommon/checksum.h"

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <string>

#include "base/CpuThreshold.h"
#include "support/testsupport.h"

namespace {

std::string md5Hex(const void* data, size_t length) {
    md5_context ctx;
    md5_init(&ctx);
    md5_update(&ctx, data, length);
    unsigned char digest[16];
    md5_final(&ctx, digest);
    char text[MD5_TEXT_SIZE];
    return md5_tostr(digest, text);
}

std::string md5Hex(const std::string& s) { return md5Hex(s.data(), s.size()); }

std::string sha256Hex(const void* data, size_t length) {
    sha256_context ctx;
    sha256_init(&ctx);
    sha256_update(&ctx, data, length);
    unsigned char digest[32];
    sha256_final(&ctx, digest);
    char text[SHA256_TEXT_SIZE];
    return sha256_tostr(digest, text);
}

std::string sha256Hex(const std::string& s) { return sha256Hex(s.data(), s.size()); }

uint32_t crc32Of(const void* data, size_t length) {
    crc32_context ctx;
    crc32_init(&ctx);
    crc32_update(&ctx, data, length);
    return crc32_final(&ctx);
}

uint32_t crc32Of(const std::string& s) { return crc32Of(s.data(), s.size()); }

// Deterministic bytes that cover every value and repeat nowhere near 1024.
std::string patternBytes(size_t size) {
    std::string s(size, '\0');
    uint32_t x = 2463534242u;
    for (size_t i = 0; i < size; ++i) {
        x ^= x << 13;
        x ^= x >> 17;
        x ^= x << 5;
        s[i] = static_cast<char>(x & 0xFF);
    }
    return s;
}

std::string firstWord(const std::string& text) {
    size_t begin = text.find_first_not_of(" \t\n");
    if (begin == std::string::npos) return std::string();
    size_t end = text.find_first_of(" \t\n", begin);
    return text.substr(begin, end == std::string::npos ? std::string::npos : end - begin);
}

std::string crcText(uint32_t crc) {
    char text[CRC32_TEXT_SIZE];
    return crc32_tostr(crc, text);
}

const uint32_t kAll = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5 |
                      FILE_CHECKSUM_SHA256;

}  // namespace

// --- Published vectors ----------------------------------------------------------------

TEST(Crc32, CheckValueOf123456789IsCbf43926) {
    EXPECT_EQ(0xCBF43926u, crc32Of("123456789"));
    EXPECT_EQ("cbf43926", crcText(crc32Of("123456789")));
}

TEST(Crc32, EmptyInputIsZeroAndPrintsEightZeros) {
    EXPECT_EQ(0u, crc32Of(""));
    EXPECT_EQ("00000000", crcText(0));
}

TEST(Crc32, ToStrPadsToEightDigitsAndUsesLowerCase) {
    EXPECT_EQ("000000ab", crcText(0xABu));
    EXPECT_EQ("ffffffff", crcText(0xFFFFFFFFu));
}

TEST(Crc32, KnownTextValues) {
    EXPECT_EQ(0x414FA339u, crc32Of("The quick brown fox jumps over the lazy dog"));
    EXPECT_EQ(0xE8B7BE43u, crc32Of("a"));
}

TEST(Md5, Rfc1321TestSuite) {
    EXPECT_EQ("d41d8cd98f00b204e9800998ecf8427e", md5Hex(""));
    EXPECT_EQ("0cc175b9c0f1b6a831c399e269772661", md5Hex("a"));
    EXPECT_EQ("900150983cd24fb0d6963f7d28e17f72", md5Hex("abc"));
    EXPECT_EQ("f96b697d7cb7938d525a2f31aaf161d0", md5Hex("message digest"));
    EXPECT_EQ("c3fcd3d76192e4007dfb496cca67e13b", md5Hex("abcdefghijklmnopqrstuvwxyz"));
    EXPECT_EQ("d174ab98d277d9f5a5611c2c9f419d9f",
              md5Hex("ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789"));
    EXPECT_EQ("57edf4a22be3c955ac49da2e2107b67a",
              md5Hex("1234567890123456789012345678901234567890"
                     "1234567890123456789012345678901234567890"));
}

TEST(Sha256, Fips180_2Examples) {
    EXPECT_EQ("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad", sha256Hex("abc"));
    EXPECT_EQ("248d6a61d20638b8e5c026930c3e6039a33ce45964ff2167f6ecedd419db06c1",
              sha256Hex("abcdbcdecdefdefgefghfghighijhijkijkljklmklmnlmnomnopnopq"));
    EXPECT_EQ("cdc76e5c9914fb9281a1c7e284d73e67f1809a48a497200e046d39ccc7112cd0",
              sha256Hex(std::string(1000000, 'a')));
}

TEST(Sha256, EmptyInput) {
    EXPECT_EQ("e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855", sha256Hex(""));
}

TEST(Digests, PaddingBoundariesAgreeWithSystemTools) {
    // Lengths around the 56- and 64-byte padding limits, checked by md5sum and
    // sha256sum on the same bytes.
    testsupport::TempDir dir;
    for (size_t length : {55u, 56u, 57u, 63u, 64u, 65u, 119u, 120u, 128u}) {
        std::string data = patternBytes(length);
        std::string path = dir.write("pad" + std::to_string(length), data);
        EXPECT_EQ(firstWord(testsupport::runCommand("md5sum '" + path + "'")), md5Hex(data))
            << length;
        EXPECT_EQ(firstWord(testsupport::runCommand("sha256sum '" + path + "'")), sha256Hex(data))
            << length;
    }
}

TEST(Digests, FeedingInPiecesEqualsFeedingAtOnce) {
    std::string data = patternBytes(1000);
    const std::string md5Whole = md5Hex(data);
    const std::string shaWhole = sha256Hex(data);
    const uint32_t crcWhole = crc32Of(data);
    for (size_t cut : {0u, 1u, 55u, 63u, 64u, 65u, 127u, 500u, 999u, 1000u}) {
        md5_context m;
        sha256_context s;
        crc32_context c;
        md5_init(&m);
        sha256_init(&s);
        crc32_init(&c);
        md5_update(&m, data.data(), cut);
        md5_update(&m, data.data() + cut, data.size() - cut);
        sha256_update(&s, data.data(), cut);
        sha256_update(&s, data.data() + cut, data.size() - cut);
        crc32_update(&c, data.data(), cut);
        crc32_update(&c, data.data() + cut, data.size() - cut);
        unsigned char md[16], sd[32];
        char mt[MD5_TEXT_SIZE], st[SHA256_TEXT_SIZE];
        md5_final(&m, md);
        sha256_final(&s, sd);
        EXPECT_EQ(md5Whole, md5_tostr(md, mt)) << cut;
        EXPECT_EQ(shaWhole, sha256_tostr(sd, st)) << cut;
        EXPECT_EQ(crcWhole, crc32_final(&c)) << cut;
    }
}

TEST(Digests, Md5FinalFillsAnArrayOfFourWords) {
    md5_context ctx;
    md5_init(&ctx);
    md5_update(&ctx, "abc", 3);
    unsigned int words[4] = {0, 0, 0, 0};
    md5_final(&ctx, words);
    char text[MD5_TEXT_SIZE];
    EXPECT_STREQ("900150983cd24fb0d6963f7d28e17f72", md5_tostr(words, text));
}

// --- Digest text ----------------------------------------------------------------------

TEST(DigestText, Md52CharIsLowerHexFirstByteFirstWithEndMark) {
    u_int128 d;
    for (int i = 0; i < 16; ++i) d.bytes[i] = static_cast<unsigned char>(0xA0 + i);
    char text[MD5_TEXT_SIZE + 1];
    std::memset(text, 'X', sizeof text);
    md52char(d, text);
    EXPECT_STREQ("a0a1a2a3a4a5a6a7a8a9aaabacadaeaf", text);
    EXPECT_EQ('\0', text[32]);
    EXPECT_EQ('X', text[33]);
}

TEST(DigestText, Md52WcharTMatchesNarrowForm) {
    u_int128 d = char2md5("900150983cd24fb0d6963f7d28e17f72");
    wchar_t text[MD5_TEXT_SIZE];
    md52wchar_t(d, text);
    EXPECT_STREQ(L"900150983cd24fb0d6963f7d28e17f72", text);
}

TEST(DigestText, Sha256CharRoundTrip) {
    const char* hex = "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad";
    u_int256 d;
    ASSERT_TRUE(char2sha256(hex, d));
    EXPECT_EQ(0xBA, d.bytes[0]);
    EXPECT_EQ(0xAD, d.bytes[31]);
    char text[SHA256_TEXT_SIZE];
    EXPECT_STREQ(hex, sha256char(d, text));
    u_int256 w;
    ASSERT_TRUE(wchar_t2sha256(L"BA7816BF8F01CFEA414140DE5DAE2223B00361A396177A9CB410FF61F20015AD", w));
    EXPECT_TRUE(w == d);
}

TEST(DigestText, Char2Md5ReadsEitherCase) {
    u_int128 lower = char2md5("0cc175b9c0f1b6a831c399e269772661");
    u_int128 upper = wchar_t2md5(L"0CC175B9C0F1B6A831C399E269772661");
    EXPECT_TRUE(lower == upper);
    EXPECT_EQ(0x0C, lower.bytes[0]);
    EXPECT_EQ(0xC1, lower.bytes[1]);
    EXPECT_EQ(0x61, lower.bytes[15]);
}

TEST(DigestText, ZeroTextGivesZeroDigestAndIsNotFull) {
    // Records without a checksum carry the text "0".
    u_int128 d;
    std::memset(d.bytes, 0x55, sizeof d.bytes);
    EXPECT_FALSE(wchar_t2md5(L"0", d));
    for (unsigned char b : d.bytes) EXPECT_EQ(0, b);
}

TEST(DigestText, DamagedTextKeepsPairsReadAndZerosTheRest) {
    u_int128 d;
    EXPECT_FALSE(char2md5("abcdzz0011", d));
    EXPECT_EQ(0xAB, d.bytes[0]);
    EXPECT_EQ(0xCD, d.bytes[1]);
    for (int i = 2; i < 16; ++i) EXPECT_EQ(0, d.bytes[i]);
    EXPECT_FALSE(char2md5(nullptr, d));
    EXPECT_FALSE(char2md5("900150983cd24fb0d6963f7d28e17f72ff", d));  // too long
    EXPECT_EQ(0x90, d.bytes[0]);
}

// --- Signatures -------------------------------------------------------------------------

TEST(Signature, StringSignatureIsMd5OfTextWithoutEndMark) {
    char out[MD5_TEXT_SIZE];
    getStringSignature_MD5(out, "abc");
    EXPECT_STREQ("900150983cd24fb0d6963f7d28e17f72", out);
    getStringSignature_MD5(out, "");
    EXPECT_STREQ("d41d8cd98f00b204e9800998ecf8427e", out);
}

TEST(Signature, NarrowHeaderSignatureIsOneMd5OverThreeTextsInOrder) {
    char out[MD5_TEXT_SIZE];
    getHeaderSignature_MD5(out, "message", " ", "digest");
    EXPECT_STREQ("f96b697d7cb7938d525a2f31aaf161d0", out);
    getHeaderSignature_MD5(out, "a", "b", "c");
    EXPECT_STREQ("900150983cd24fb0d6963f7d28e17f72", out);
}

TEST(Signature, WideHeaderSignatureDigestsOnlyFirstQuarterOfEachText) {
    // Each text gives its character count as byte count: of L"abcd" only the
    // four bytes of L'a' count ('a', 0, 0, 0 on this little-endian host).
    char out[MD5_TEXT_SIZE];
    getHeaderSignature_MD5(out, L"abcd", L"efgh", L"ijkl");
    EXPECT_STREQ("1ffd348dbbc24c21babeebd6b84d7dfa", out);
    EXPECT_EQ(md5Hex(std::string("a\0\0\0e\0\0\0i\0\0\0", 12)), out);
    char narrow[MD5_TEXT_SIZE];
    getHeaderSignature_MD5(narrow, "abcd", "efgh", "ijkl");
    EXPECT_STRNE(narrow, out);
}

TEST(Signature, FileSignatureOverFirstSecondAndNumber) {
    char out[MD5_TEXT_SIZE];
    ASSERT_TRUE(getFileSignature_MD5(out, "first", "second", 42, 0));
    EXPECT_STREQ("cc6bf15a3285b262f6172431c6dfc30b", out);  // md5("firstsecond42")
}

TEST(Signature, FileSignatureSkipsNullFirst) {
    char out[MD5_TEXT_SIZE];
    ASSERT_TRUE(getFileSignature_MD5(out, nullptr, "second", 42, 0));
    EXPECT_STREQ("01f011a3331908865ac79b1e2c7073db", out);  // md5("second42")
}

TEST(Signature, FileSignaturePadsEachPieceWithZeros) {
    char out[MD5_TEXT_SIZE];
    ASSERT_TRUE(getFileSignature_MD5(out, "first", "second", 42, 2));
    EXPECT_STREQ("d69d67e34c624e5697a0752cd3422e4f", out);  // "first\0\0second\0\042\0\0"
    ASSERT_TRUE(getFileSignature_MD5(out, "x", "y", 0, 1024));
    std::string expected = "x" + std::string(1024, '\0') + "y" + std::string(1024, '\0') + "0" +
                           std::string(1024, '\0');
    EXPECT_EQ(md5Hex(expected), out);
}

TEST(Signature, FileSignatureWithPadAboveBlockIsRefusedWithTrace) {
    testsupport::TraceCapture trace;
    char out[MD5_TEXT_SIZE] = "untouched";
    EXPECT_FALSE(getFileSignature_MD5(out, "first", "second", 1, 1025));
    EXPECT_STREQ("", out);
    EXPECT_TRUE(trace.contains("getFileSignature_MD5")) << trace.dump();
}

TEST(Signature, FileSignatureWithNullSecondIsRefused) {
    char out[MD5_TEXT_SIZE] = "untouched";
    EXPECT_FALSE(getFileSignature_MD5(out, "first", nullptr, 1, 0));
    EXPECT_STREQ("", out);
}

// --- computeFileChecksumInfo: results -------------------------------------------------

TEST(FileChecksum, FlagsZeroOnMissingFileIsSuccessAndValid) {
    FileChecksumInfo info;
    info.flags = 0;
    info.valid = false;
    EXPECT_EQ(0, computeFileChecksumInfo(info, "/nonexistent/dir/of/fscanner/file"));
    EXPECT_TRUE(info.valid);
    EXPECT_EQ(0u, info.crc32);
}

TEST(FileChecksum, EmptyFileGivesSumsOfEmptyInputWithZeroCrcAndQ32) {
    testsupport::TempDir dir;
    std::string path = dir.write("empty", "");
    FileChecksumInfo info;
    info.flags = kAll;
    info.crc32 = 7;
    info.q32 = 7;
    EXPECT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_TRUE(info.valid);
    EXPECT_EQ(0u, info.crc32);
    EXPECT_EQ(0u, info.q32);
    char text[SHA256_TEXT_SIZE];
    EXPECT_STREQ("d41d8cd98f00b204e9800998ecf8427e", md52char(info.md5, text));
    EXPECT_STREQ("e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855",
                 sha256char(info.sha256, text));
}

TEST(FileChecksum, FileUnder1024BytesHasQ32EqualToCrc32) {
    testsupport::TempDir dir;
    std::string path = dir.write("small", patternBytes(1000));
    FileChecksumInfo info;
    info.flags = kAll;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_EQ(info.crc32, info.q32);
    EXPECT_EQ(crc32Of(patternBytes(1000)), info.crc32);
}

TEST(FileChecksum, Q32CoversFirst1024BytesOfLargerFile) {
    testsupport::TempDir dir;
    std::string data = patternBytes(5000);
    std::string path = dir.write("large", data);
    FileChecksumInfo info;
    info.flags = kAll;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_EQ(crc32Of(data.data(), 1024), info.q32);
    EXPECT_EQ(crc32Of(data), info.crc32);
    EXPECT_NE(info.crc32, info.q32);
}

TEST(FileChecksum, SumsNotAskedForAreThoseOfEmptyInput) {
    testsupport::TempDir dir;
    std::string path = dir.write("f", "hello world");
    FileChecksumInfo info;
    info.flags = FILE_CHECKSUM_CRC32;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_EQ(crc32Of("hello world"), info.crc32);
    EXPECT_EQ(0u, info.q32);
    char text[SHA256_TEXT_SIZE];
    EXPECT_STREQ("d41d8cd98f00b204e9800998ecf8427e", md52char(info.md5, text));
    EXPECT_STREQ("e3b0c44298fc1c149afbf4c8996fb92427ae41e4649b934ca495991b7852b855",
                 sha256char(info.sha256, text));
}

TEST(FileChecksum, MissingFileGives2AndLeavesSums) {
    FileChecksumInfo info;
    info.flags = kAll;
    info.crc32 = 0x1234;
    info.q32 = 0x5678;
    std::memset(info.md5.bytes, 0x11, sizeof info.md5.bytes);
    testsupport::TempDir dir;
    EXPECT_EQ(2, computeFileChecksumInfo(info, dir.file("missing").c_str()));
    EXPECT_FALSE(info.valid);
    EXPECT_EQ(0x1234u, info.crc32);
    EXPECT_EQ(0x5678u, info.q32);
    EXPECT_EQ(0x11, info.md5.bytes[0]);
}

TEST(FileChecksum, UnreadableFileGives13) {
    testsupport::TempDir dir;
    std::string path = dir.write("secret", "data");
    ASSERT_EQ(0, chmod(path.c_str(), 0));
    if (geteuid() != 0) {
        FileChecksumInfo info;
        info.flags = FILE_CHECKSUM_MD5;
        EXPECT_EQ(13, computeFileChecksumInfo(info, path.c_str()));
        EXPECT_FALSE(info.valid);
        return;
    }
    // As root, permissions are not enforced: run the open as an unprivileged
    // user in a child process and report the result through the exit code.
    pid_t child = fork();
    ASSERT_NE(-1, child);
    if (child == 0) {
        if (setgid(65534) != 0 || setuid(65534) != 0) _exit(100);
        FileChecksumInfo info;
        info.flags = FILE_CHECKSUM_MD5;
        int rc = computeFileChecksumInfo(info, path.c_str());
        _exit(rc == 13 && !info.valid ? 0 : 101);
    }
    int status = 0;
    ASSERT_EQ(child, waitpid(child, &status, 0));
    ASSERT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == 100) GTEST_SKIP() << "cannot drop privileges";
    EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST(FileChecksum, OtherOpenFailureGivesMinus1) {
    testsupport::TempDir dir;
    std::string file = dir.write("plain", "x");
    FileChecksumInfo info;
    info.flags = FILE_CHECKSUM_MD5;
    // A path through a regular file fails with ENOTDIR.
    EXPECT_EQ(-1, computeFileChecksumInfo(info, (file + "/below").c_str()));
    EXPECT_FALSE(info.valid);
    info.valid = true;
    EXPECT_EQ(-1, computeFileChecksumInfo(info, nullptr));
    EXPECT_FALSE(info.valid);
}

TEST(FileChecksum, ReadFailureGivesMinus2AndStoresSumsOfWhatWasRead) {
    // A directory opens for reading, but reading it fails.
    testsupport::TempDir dir;
    std::string sub = dir.mkdirs("sub");
    FileChecksumInfo info;
    info.flags = kAll;
    info.crc32 = 0x1234;
    EXPECT_EQ(-2, computeFileChecksumInfo(info, sub.c_str()));
    EXPECT_FALSE(info.valid);
    EXPECT_EQ(0u, info.crc32);  // nothing was read: the sums of empty input
    char text[MD5_TEXT_SIZE];
    EXPECT_STREQ("d41d8cd98f00b204e9800998ecf8427e", md52char(info.md5, text));
}

TEST(FileChecksum, FlagsBeyondTheFourSumsAreIgnoredForQ32Only) {
    testsupport::TempDir dir;
    std::string data = patternBytes(9000);
    std::string path = dir.write("f", data);
    CpuThreshold::Initialize(nullptr);
    FileChecksumInfo info;
    info.flags = FILE_CHECKSUM_Q32 | 0x100;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_EQ(1u, CpuThreshold::iterations());
    EXPECT_EQ(crc32Of(data.data(), 1024), info.q32);
}

// --- computeFileChecksumInfo against system tools ---------------------------------------

class FileChecksumSizes : public ::testing::TestWithParam<size_t> {};

TEST_P(FileChecksumSizes, AgreesWithMd5sumSha256sumAndGzipCrc) {
    const size_t size = GetParam();
    testsupport::TempDir dir;
    std::string data = patternBytes(size);
    std::string path = dir.write("data.bin", data);
    FileChecksumInfo info;
    info.flags = kAll;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    EXPECT_TRUE(info.valid);

    char text[SHA256_TEXT_SIZE];
    EXPECT_EQ(firstWord(testsupport::runCommand("md5sum '" + path + "'")), md52char(info.md5, text));
    EXPECT_EQ(firstWord(testsupport::runCommand("sha256sum '" + path + "'")),
              sha256char(info.sha256, text));
    // gzip stores the CRC-32 of its input, little-endian, in its trailer.
    EXPECT_EQ(firstWord(testsupport::runCommand("gzip -c '" + path +
                                                "' | tail -c8 | od -An -tx4 -N4")),
              crcText(info.crc32));
    EXPECT_EQ(firstWord(testsupport::runCommand("head -c 1024 '" + path +
                                                "' | gzip -c | tail -c8 | od -An -tx4 -N4")),
              crcText(info.q32));
    EXPECT_EQ(crc32Of(data), info.crc32);
    EXPECT_EQ(crc32Of(data.data(), size < 1024 ? size : 1024), info.q32);
}

TEST_P(FileChecksumSizes, AgreesWithCksumCrc32bWhenAvailable) {
    int status = 0;
    testsupport::runCommand("cksum -a crc32b /dev/null >/dev/null 2>&1", &status);
    if (status != 0) GTEST_SKIP() << "cksum has no crc32b on this system";
    const size_t size = GetParam();
    testsupport::TempDir dir;
    std::string path = dir.write("data.bin", patternBytes(size));
    FileChecksumInfo info;
    info.flags = FILE_CHECKSUM_CRC32;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    // The tool prints the value in decimal.
    std::string out = firstWord(testsupport::runCommand("cksum -a crc32b '" + path + "'"));
    EXPECT_EQ(std::to_string(info.crc32), out);
}

INSTANTIATE_TEST_SUITE_P(Sizes, FileChecksumSizes,
                         ::testing::Values(0u, 1u, 1023u, 1024u, 1025u, 4096u, 4097u, 1048576u));

// --- computeFileChecksumInfo: throttle calls and read sizes ------------------------------

namespace {

unsigned long long iterationsFor(size_t size, uint32_t flags, FileChecksumInfo* out = nullptr) {
    testsupport::TempDir dir;
    std::string path = dir.write("f", patternBytes(size));
    CpuThreshold::Initialize(nullptr);
    FileChecksumInfo info;
    info.flags = flags;
    EXPECT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    if (out != nullptr) *out = info;
    return CpuThreshold::iterations();
}

}  // namespace

TEST(FileChecksumThrottle, OneCallPerSumPerChunkPlusOneForQ32) {
    // 4097 bytes in chunks of 4096: chunk 1 MD5, SHA-256, CRC32, Q32; chunk 2
    // MD5, SHA-256, CRC32.
    EXPECT_EQ(7u, iterationsFor(4097, kAll));
    EXPECT_EQ(4u, iterationsFor(4096, kAll));
}

TEST(FileChecksumThrottle, EmptyFileMakesNoCall) { EXPECT_EQ(0u, iterationsFor(0, kAll)); }

TEST(FileChecksumThrottle, FlagsZeroMakesNoCall) { EXPECT_EQ(0u, iterationsFor(100, 0)); }

TEST(FileChecksumThrottle, Q32AloneReadsOnceEvenForLargeFile) {
    FileChecksumInfo info;
    EXPECT_EQ(1u, iterationsFor(1048576, FILE_CHECKSUM_Q32, &info));
    EXPECT_EQ(crc32Of(patternBytes(1024)), info.q32);
    EXPECT_TRUE(info.valid);
}

TEST(FileChecksumThrottle, Q32WithSha256AloneReadsIn1024ByteChunks) {
    // 2048 bytes: chunk 1 SHA-256 and Q32, chunk 2 SHA-256.  Chunks of 4096
    // would give 2.
    FileChecksumInfo info;
    EXPECT_EQ(3u, iterationsFor(2048, FILE_CHECKSUM_Q32 | FILE_CHECKSUM_SHA256, &info));
    EXPECT_EQ(sha256Hex(patternBytes(2048)), [&] {
        char text[SHA256_TEXT_SIZE];
        return std::string(sha256char(info.sha256, text));
    }());
    EXPECT_EQ(crc32Of(patternBytes(1024)), info.q32);
    EXPECT_EQ(4u, iterationsFor(3072, FILE_CHECKSUM_Q32 | FILE_CHECKSUM_SHA256));
}

TEST(FileChecksumThrottle, Q32WithMd5OrCrcReadsIn4096ByteChunks) {
    // 2048 bytes fit one chunk of 4096.
    EXPECT_EQ(3u, iterationsFor(2048, FILE_CHECKSUM_Q32 | FILE_CHECKSUM_SHA256 | FILE_CHECKSUM_MD5));
    EXPECT_EQ(2u, iterationsFor(2048, FILE_CHECKSUM_Q32 | FILE_CHECKSUM_CRC32));
    // 8192 bytes: CRC32 and Q32, then CRC32.
    EXPECT_EQ(3u, iterationsFor(8192, FILE_CHECKSUM_Q32 | FILE_CHECKSUM_CRC32));
}

TEST(FileChecksumThrottle, Sha256AloneReadsIn4096ByteChunks) {
    EXPECT_EQ(1u, iterationsFor(2048, FILE_CHECKSUM_SHA256));
    EXPECT_EQ(3u, iterationsFor(8193, FILE_CHECKSUM_SHA256));
}

TEST(DigestText, PointerFormsFillTheDigestAndRefuseNull) {
    u_int128 d;
    ASSERT_TRUE(wchar_t2md5(L"900150983cd24fb0d6963f7d28e17f72", &d));
    EXPECT_EQ(0x90, d.bytes[0]);
    EXPECT_FALSE(char2md5("900150983cd24fb0d6963f7d28e17f72", static_cast<u_int128*>(nullptr)));
    u_int256 s;
    EXPECT_FALSE(char2sha256("ab", &s));
    EXPECT_EQ(0xAB, s.bytes[0]);
    EXPECT_EQ(0, s.bytes[1]);
}
