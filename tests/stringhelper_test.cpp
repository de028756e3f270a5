// Tests of the common text helpers: numbers, trimming, paths, UTF-8, time
// formats, the tokeniser, temporary and debug files.
#include <gtest/gtest.h>

#include <sys/time.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <cwchar>
#include <string>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fscommon/stringhelper.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

// Sets TZ for the life of the object and restores the previous value.
class ScopedTimeZone {
public:
    explicit ScopedTimeZone(const char* zone) {
        const char* old = std::getenv("TZ");
        hadOld_ = old != nullptr;
        if (hadOld_) old_ = old;
        setenv("TZ", zone, 1);
        tzset();
    }
    ~ScopedTimeZone() {
        if (hadOld_) {
            setenv("TZ", old_.c_str(), 1);
        } else {
            unsetenv("TZ");
        }
        tzset();
    }

private:
    bool hadOld_;
    std::string old_;
};

// Runs in dir for the life of the object.
class ScopedWorkingDirectory {
public:
    explicit ScopedWorkingDirectory(const std::string& dir) {
        char buffer[4096];
        old_ = getcwd(buffer, sizeof(buffer)) != nullptr ? buffer : "/";
        EXPECT_EQ(chdir(dir.c_str()), 0);
    }
    ~ScopedWorkingDirectory() { EXPECT_EQ(chdir(old_.c_str()), 0); }

private:
    std::string old_;
};

std::vector<unsigned char> bytesOf(const unsigned char* text) {
    std::vector<unsigned char> bytes;
    while (*text != 0) bytes.push_back(*text++);
    return bytes;
}

}  // namespace

// ---- numbers ----------------------------------------------------------------

TEST(WcsItoa, ZeroGivesZero) {
    wchar_t out[16];
    EXPECT_STREQ(wcs_itoa(0, out), L"0");
    EXPECT_STREQ(out, L"0");
}

TEST(WcsItoa, LargestValueAndStaticBlockForNullOut) {
    wchar_t out[16];
    EXPECT_STREQ(wcs_itoa(4294967295u, out), L"4294967295");
    wchar_t* block = wcs_itoa(1234, nullptr);
    ASSERT_NE(block, nullptr);
    EXPECT_STREQ(block, L"1234");
    // The static block is reused by the next call.
    EXPECT_EQ(wcs_itoa(7, nullptr), block);
    EXPECT_STREQ(block, L"7");
}

TEST(WcsItoa64, SixtyFourBitValuesHaveTheirOwnStaticBlock) {
    wchar_t out[32];
    EXPECT_STREQ(wcs_itoa64(18446744073709551615ULL, out), L"18446744073709551615");
    wchar_t* block64 = wcs_itoa64(5000000000ULL, nullptr);
    wchar_t* block32 = wcs_itoa(9, nullptr);
    EXPECT_NE(block64, block32);
    EXPECT_STREQ(block64, L"5000000000");
    EXPECT_STREQ(block32, L"9");
}

TEST(Str2Uint64, NonDigitOrEmptyGivesZero) {
    wchar_t bad[] = L"12a";
    wchar_t empty[] = L"";
    EXPECT_EQ(str2uint64(bad), 0ULL);
    EXPECT_EQ(str2uint64(empty), 0ULL);
    EXPECT_EQ(str2uint64(nullptr), 0ULL);
    wchar_t sign[] = L"-5";
    EXPECT_EQ(str2uint64(sign), 0ULL);
    wchar_t fraction[] = L"1.5";
    EXPECT_EQ(str2uint64(fraction), 0ULL);
}

TEST(Str2Uint64, DigitsGiveTheirValue) {
    wchar_t small[] = L"0042";
    EXPECT_EQ(str2uint64(small), 42ULL);
    wchar_t largest[] = L"9223372036854775807";
    EXPECT_EQ(str2uint64(largest), 9223372036854775807ULL);
}

TEST(Str2Uint64, ValueBeyondSignedRangeStopsAtMaximum) {
    wchar_t above[] = L"9223372036854775808";
    EXPECT_EQ(str2uint64(above), 9223372036854775807ULL);
    wchar_t big[] = L"18446744073709551615";
    EXPECT_EQ(str2uint64(big), 9223372036854775807ULL);
}

TEST(Str2Uint64, DigitsBehindTheTwentyThirdAreNotRead) {
    wchar_t longest[] = L"00000000000000000000123";  // 23 digits
    EXPECT_EQ(str2uint64(longest), 123ULL);
    wchar_t tooLong[] = L"000000000000000000000123";  // 24 digits: "3" is not read
    EXPECT_EQ(str2uint64(tooLong), 12ULL);
    wchar_t tooLongBad[] = L"00000000000000000000000x";  // but every character must be a digit
    EXPECT_EQ(str2uint64(tooLongBad), 0ULL);
}

// ---- in-place helpers ---------------------------------------------------------

TEST(Trim, RtrimOfBlanksOnlyGivesEmptyText) {
    wchar_t blanks[] = L"    ";
    EXPECT_EQ(rtrim(blanks), blanks);
    EXPECT_STREQ(blanks, L"");
}

TEST(Trim, RtrimAndLtrimLeaveTabsAlone) {
    wchar_t right[] = L" a\t  ";
    EXPECT_STREQ(rtrim(right), L" a\t");
    wchar_t left[] = L"  \tb ";
    EXPECT_STREQ(ltrim(left), L"\tb ");
    EXPECT_EQ(rtrim(nullptr), nullptr);
    EXPECT_EQ(ltrim(nullptr), nullptr);
}

TEST(WcsBtw, FindsFirstCharacterInClosedRange) {
    wchar_t text[] = L"a/b/c";
    EXPECT_EQ(wcsbtw(text, text + 4, L'/'), text + 1);
    // The range is closed: the last character counts.
    EXPECT_EQ(wcsbtw(text + 2, text + 3, L'/'), text + 3);
    EXPECT_EQ(wcsbtw(text, text + 4, L'x'), nullptr);
    EXPECT_EQ(wcsbtw(text + 3, text + 1, L'/'), nullptr);
}

TEST(MyWcsWcs, PlainSearchAndEmptyNeedle) {
    wchar_t text[] = L"aaab";
    EXPECT_EQ(my_wcswcs(text, L"aab"), text + 1);
    EXPECT_EQ(my_wcswcs(text, L""), text);
    EXPECT_EQ(my_wcswcs(text, L"abc"), nullptr);
}

TEST(ReplaceChar, ReplacesEveryOccurrenceAndAcceptsNull) {
    wchar_t text[] = L"a\\b\\c";
    EXPECT_STREQ(replaceChar(text, L'\\', L'/'), L"a/b/c");
    EXPECT_EQ(replaceChar(nullptr, L'a', L'b'), nullptr);
}

TEST(CaseHelpers, LowerAndUpperInPlaceOrIntoOut) {
    wchar_t text[] = L"MiXeD.Txt";
    EXPECT_STREQ(wcstowlower(text), L"mixed.txt");
    wchar_t out[16];
    EXPECT_STREQ(wcsupper(text, out), L"MIXED.TXT");
    EXPECT_STREQ(text, L"mixed.txt");
    EXPECT_STREQ(wcsupper(text), L"MIXED.TXT");
}

TEST(WcsCpy, AllocatesForNullTarget) {
    wchar_t* dst = nullptr;
    EXPECT_STREQ(__wcscpy(&dst, L"abc"), L"abc");
    ASSERT_NE(dst, nullptr);
    EXPECT_STREQ(dst, L"abc");
    kelm_free(dst);
}

TEST(WcsCpy, ReusesBlockForShorterOrEqualTextAndReplacesForLonger) {
    wchar_t* dst = nullptr;
    __wcscpy(&dst, L"abcdef");
    wchar_t* first = dst;
    __wcscpy(&dst, L"xy");
    EXPECT_EQ(dst, first);
    EXPECT_STREQ(dst, L"xy");
    // The block holds "xy" now: anything longer than that replaces it, even
    // if the block was once larger.
    __wcscpy(&dst, L"xyz");
    EXPECT_STREQ(dst, L"xyz");
    __wcscpy(&dst, L"a much longer text than before");
    EXPECT_STREQ(dst, L"a much longer text than before");
    kelm_free(dst);
}

TEST(WcsCpy, NullSourceDoesNothing) {
    wchar_t* dst = nullptr;
    EXPECT_EQ(__wcscpy(&dst, nullptr), nullptr);
    EXPECT_EQ(dst, nullptr);
    __wcscpy(&dst, L"keep");
    __wcscpy(&dst, nullptr);
    EXPECT_STREQ(dst, L"keep");
    kelm_free(dst);
}

// ---- path and string building ----------------------------------------------------

TEST(GetFullPathName, AddsSeparatorUnlessDirEndsInIt) {
    wchar_t* a = getFullPathName(L"/usr", L"bin");
    wchar_t* b = getFullPathName(L"/usr/", L"bin");
    wchar_t* c = getFullPathName(L"/", L"etc");
    wchar_t* d = getFullPathName(L"", L"x");
    EXPECT_STREQ(a, L"/usr/bin");
    EXPECT_STREQ(b, L"/usr/bin");
    EXPECT_STREQ(c, L"/etc");
    EXPECT_STREQ(d, L"/x");
    kelm_free(a);
    kelm_free(b);
    kelm_free(c);
    kelm_free(d);
}

TEST(GetFullPathName, NullArgumentGivesNull) {
    EXPECT_EQ(getFullPathName(nullptr, L"a"), nullptr);
    EXPECT_EQ(getFullPathName(L"/a", nullptr), nullptr);
}

TEST(FullPath2Component, SplitsAtLastSeparator) {
    wchar_t path[] = L"/usr/local/bin";
    wchar_t* dir = nullptr;
    wchar_t* name = nullptr;
    ASSERT_TRUE(fullPath2Component(path, L'/', &dir, &name));
    EXPECT_STREQ(dir, L"/usr/local");
    EXPECT_STREQ(name, L"bin");
    kelm_free(dir);
    kelm_free(name);
}

TEST(FullPath2Component, PathWithoutSeparatorFailsCleanly) {
    wchar_t path[] = L"plain";
    wchar_t* dir = reinterpret_cast<wchar_t*>(1);
    wchar_t* name = reinterpret_cast<wchar_t*>(1);
    EXPECT_FALSE(fullPath2Component(path, L'/', &dir, &name));
    EXPECT_EQ(dir, nullptr);
    EXPECT_EQ(name, nullptr);
}

TEST(InsertAndReplaceString, ReplacesEveryOccurrenceWithoutLooping) {
    wchar_t* result = insertAndReplaceString(L"a.b.c", L".", L"..");
    EXPECT_STREQ(result, L"a..b..c");
    kelm_free(result);
    wchar_t* shorter = insertAndReplaceString(L"%home%/x/%home%", L"%home%", L"~");
    EXPECT_STREQ(shorter, L"~/x/~");
    kelm_free(shorter);
    EXPECT_EQ(insertAndReplaceString(nullptr, L"a", L"b"), nullptr);
    EXPECT_EQ(insertAndReplaceString(L"a", nullptr, L"b"), nullptr);
    EXPECT_EQ(insertAndReplaceString(L"a", L"b", nullptr), nullptr);
}

TEST(WcsStringCat, PrependsWhenBothLengthsPlusFourFit) {
    wchar_t buffer[16] = L"bin";
    wchar_t prefix[] = L"/u";
    // 2 + 3 + 4 = 9: size 9 is enough.
    EXPECT_EQ(wcs_stringCat(prefix, buffer, 9), 1);
    EXPECT_STREQ(buffer, L"/ubin");
}

TEST(WcsStringCat, RefusesWhenSumExceedsSize) {
    wchar_t buffer[16] = L"bin";
    wchar_t prefix[] = L"/u";
    EXPECT_EQ(wcs_stringCat(prefix, buffer, 8), 0);
    EXPECT_STREQ(buffer, L"bin");
}

TEST(ElapsedTime, MillisecondsBetweenTwoTimevals) {
    timeval start = {1, 500000};
    timeval end = {3, 250000};
    EXPECT_EQ(elapsedTime(start, end), 1750u);
    EXPECT_EQ(elapsedTime(end, end), 0u);
}

// ---- files -------------------------------------------------------------------------

TEST(FileHelpers, RenameAndRemoveUseNarrowNames) {
    TempDir dir;
    std::string from = dir.write("a.txt", "x");
    std::string to = dir.file("b.txt");
    std::wstring wideFrom(from.begin(), from.end());
    std::wstring wideTo(to.begin(), to.end());
    EXPECT_EQ(renameFile(&wideFrom[0], &wideTo[0]), 0);
    EXPECT_FALSE(testsupport::fileExists(from));
    EXPECT_TRUE(testsupport::fileExists(to));
    EXPECT_EQ(removeFile(&wideTo[0]), 0);
    EXPECT_FALSE(testsupport::fileExists(to));
    EXPECT_NE(removeFile(&wideTo[0]), 0);
}

TEST(GetTempFileDefault, CreatesFirstFreeNameAndLeavesItEmpty) {
    TempDir dir;
    ScopedWorkingDirectory cwd(dir.path());
    dir.write("kel_0", "taken");
    char* name = getTempFile_Default(nullptr);
    ASSERT_NE(name, nullptr);
    EXPECT_STREQ(name, "./kel_1");
    EXPECT_TRUE(testsupport::fileExists(dir.file("kel_1")));
    EXPECT_EQ(testsupport::readFile(dir.file("kel_1")), "");
    EXPECT_EQ(testsupport::readFile(dir.file("kel_0")), "taken");
    char* next = getTempFile_Default(nullptr);
    EXPECT_STREQ(next, "./kel_2");
    delete[] name;
    delete[] next;
}

TEST(GetTempFileDefault, PrefixReplacesKel) {
    TempDir dir;
    ScopedWorkingDirectory cwd(dir.path());
    char prefix[] = "res_";
    char* name = getTempFile_Default(prefix);
    EXPECT_STREQ(name, "./res_0");
    EXPECT_TRUE(testsupport::fileExists(dir.file("res_0")));
    delete[] name;
}

TEST(DebugFile, WritesOnlyWhileSwitchedOn) {
    TempDir dir;
    std::string path = dir.file("debug.log");
    debug("before %d\n", 1);
    startDebug(path.c_str());
    EXPECT_STREQ(debugFile, path.c_str());
    debug("value %d %s\n", 42, "x");
    stopDebug();
    debug("after %d\n", 2);
    EXPECT_EQ(testsupport::readFile(path), "value 42 x\n");
    startDebug();
    debug("again\n");
    stopDebug();
    EXPECT_EQ(testsupport::readFile(path), "value 42 x\nagain\n");
}

// ---- tokenizer ------------------------------------------------------------------------

TEST(Tokenize, OperatorsQuotesAndBlanks) {
    wchar_t token[64];
    const wchar_t* text = L" (a & \"b c\") | !d ";
    std::vector<std::wstring> tokens;
    ASSERT_EQ(tokenize(text, token, sizeof(token)), 1);
    tokens.push_back(token);
    for (int i = 0; i < 20 && token[0] != L'\0'; ++i) {
        ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
        tokens.push_back(token);
    }
    std::vector<std::wstring> expected = {L"(", L"a", L"&", L"b c", L")", L"|", L"!", L"d", L""};
    EXPECT_EQ(tokens, expected);
    // At the end it stays at the end.
    EXPECT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"");
}

TEST(Tokenize, BlanksOutsideQuotesAreDroppedInsideAToken) {
    wchar_t token[64];
    ASSERT_EQ(tokenize(L"ab cd|e", token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"abcd");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"|");
}

TEST(Tokenize, TokenThatDoesNotFitLeavesPositionAtItsStart) {
    wchar_t token[64];
    // 12 bytes hold two characters and the end mark.
    ASSERT_EQ(tokenize(L"abc&x", token, 3 * sizeof(wchar_t)), 0);
    EXPECT_STREQ(token, L"");
    ASSERT_EQ(tokenize(nullptr, token, 4 * sizeof(wchar_t)), 1);
    EXPECT_STREQ(token, L"abc");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"&");
}

TEST(Tokenize, QuotedOperatorsStayTextAndUnclosedQuoteRunsToTheEnd) {
    wchar_t token[32];
    ASSERT_EQ(tokenize(L"\"a (b)|c\"&\"open end", token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"a (b)|c");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"&");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"open end");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"");
}

TEST(Tokenize, NewTextRestarts) {
    wchar_t token[16];
    ASSERT_EQ(tokenize(L"a|b", token, sizeof(token)), 1);
    ASSERT_EQ(tokenize(L"z", token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"z");
    ASSERT_EQ(tokenize(nullptr, token, sizeof(token)), 1);
    EXPECT_STREQ(token, L"");
}

// ---- UTF-8 ------------------------------------------------------------------------------

TEST(StringToUTF8, TwoByteCharacterIntoThreeBytesIsSkipped) {
    unsigned char out[3] = {0x55, 0x55, 0x55};
    EXPECT_EQ(utils::stringToUTF8(out, 3, L"\u00e9"), 0u);
    EXPECT_EQ(out[0], 0);
}

TEST(StringToUTF8, TwoByteCharacterIntoFourBytesIsWritten) {
    unsigned char out[4];
    EXPECT_EQ(utils::stringToUTF8(out, 4, L"\u00e9"), 1u);
    EXPECT_EQ(bytesOf(out), (std::vector<unsigned char>{0xC3, 0xA9}));
}

TEST(StringToUTF8, SkippedCharacterLetsShorterOnesFollow) {
    unsigned char out[3];
    // Two usable bytes: "é" needs more than 2 left, "a" and "b" need 1 each.
    EXPECT_EQ(utils::stringToUTF8(out, 3, L"\u00e9ab"), 2u);
    EXPECT_EQ(bytesOf(out), (std::vector<unsigned char>{'a', 'b'}));
}

TEST(StringToUTF8, CountsCharactersNotBytes) {
    unsigned char out[32];
    EXPECT_EQ(utils::stringToUTF8(out, sizeof(out), L"a\u00e9\u20ac\U0001F600"), 4u);
    EXPECT_EQ(bytesOf(out), (std::vector<unsigned char>{'a', 0xC3, 0xA9, 0xE2, 0x82, 0xAC, 0xF0, 0x9F, 0x98,
                                                         0x80}));
}

TEST(StringToUTF8, MarginIsOneByteLargerThanNeeded) {
    unsigned char out[8];
    // Three-byte character: 4 usable bytes suffice, 3 do not.
    EXPECT_EQ(utils::stringToUTF8(out, 5, L"\u20ac"), 1u);
    EXPECT_EQ(utils::stringToUTF8(out, 4, L"\u20ac"), 0u);
    // Four-byte character: 5 usable bytes suffice, 4 do not.
    EXPECT_EQ(utils::stringToUTF8(out, 6, L"\U0001F600"), 1u);
    EXPECT_EQ(utils::stringToUTF8(out, 5, L"\U0001F600"), 0u);
    EXPECT_EQ(out[0], 0);
}

TEST(StringToUTF8, BeyondUnicodeBecomesQuestionMark) {
    unsigned char out[8];
    wchar_t text[] = {static_cast<wchar_t>(0x110000), L'x', 0};
    EXPECT_EQ(utils::stringToUTF8(out, sizeof(out), text), 2u);
    EXPECT_STREQ(reinterpret_cast<char*>(out), "?x");
}

TEST(StringToUTF8, NullOutOrZeroSizeGivesZero) {
    unsigned char out[4] = {1, 1, 1, 1};
    EXPECT_EQ(utils::stringToUTF8(nullptr, 4, L"a"), 0u);
    EXPECT_EQ(utils::stringToUTF8(out, 0, L"a"), 0u);
    EXPECT_EQ(out[0], 1);
    EXPECT_EQ(utils::stringToUTF8(out, 1, L"a"), 0u);
    EXPECT_EQ(out[0], 0);
}

TEST(DynamicBuffer, GrowsToSixTimesLengthPlusOneAndNeverShrinks) {
    utils::DynamicBuffer<unsigned char> buffer;
    EXPECT_EQ(buffer.get(), nullptr);
    EXPECT_EQ(buffer.capacity(), 0u);
    EXPECT_EQ(utils::stringToUTF8(buffer, L"abcd"), 4u);
    EXPECT_EQ(buffer.capacity(), 25u);
    EXPECT_STREQ(reinterpret_cast<char*>(buffer.get()), "abcd");
    unsigned char* block = buffer.get();
    EXPECT_EQ(utils::stringToUTF8(buffer, L"\u00e9"), 1u);
    EXPECT_EQ(buffer.get(), block);
    EXPECT_EQ(buffer.capacity(), 25u);
    EXPECT_EQ(bytesOf(buffer.get()), (std::vector<unsigned char>{0xC3, 0xA9}));
    // Worst case: every character a four-byte one still fits.
    EXPECT_EQ(utils::stringToUTF8(buffer, L"\U0001F600\U0001F600\U0001F600\U0001F600\U0001F600"), 5u);
    EXPECT_EQ(buffer.capacity(), 31u);
    EXPECT_EQ(std::strlen(reinterpret_cast<char*>(buffer.get())), 20u);
}

TEST(DynamicBuffer, GrowingGivesZeroedBlock) {
    utils::DynamicBuffer<unsigned char> buffer;
    ASSERT_TRUE(buffer.ensure(8));
    for (unsigned int i = 0; i < 8; ++i) EXPECT_EQ(buffer.get()[i], 0);
    std::memset(buffer.get(), 0xAB, 8);
    ASSERT_TRUE(buffer.ensure(4));
    EXPECT_EQ(buffer.get()[0], 0xAB);
    ASSERT_TRUE(buffer.ensure(16));
    for (unsigned int i = 0; i < 16; ++i) EXPECT_EQ(buffer.get()[i], 0);
    buffer.release();
    EXPECT_EQ(buffer.capacity(), 0u);
}

TEST(Utf8ToWideChar, DecodesValidSequences) {
    wchar_t out[16];
    const unsigned char text[] = {'h', 0xC3, 0xA9, 0xE2, 0x82, 0xAC, 0xF0, 0x9F, 0x98, 0x80, 0};
    EXPECT_EQ(utils::utf8ToWideChar(out, 16, text), 4u);
    EXPECT_STREQ(out, L"h\u00e9\u20ac\U0001F600");
}

TEST(Utf8ToWideChar, StrayContinuationGivesItsLowSixBits) {
    wchar_t out[8];
    const unsigned char text[] = {0xA9, 'x', 0};
    EXPECT_EQ(utils::utf8ToWideChar(out, 8, text), 2u);
    EXPECT_EQ(out[0], static_cast<wchar_t>(0x29));
    EXPECT_EQ(out[1], L'x');
}

TEST(Utf8ToWideChar, TruncatedSequenceSwallowsTheNextByte) {
    wchar_t out[8];
    const unsigned char text[] = {0xC3, 'A', 'B', 0};
    EXPECT_EQ(utils::utf8ToWideChar(out, 8, text), 2u);
    EXPECT_EQ(out[0], static_cast<wchar_t>((0x03 << 6) | 0x01));
    EXPECT_EQ(out[1], L'B');
}

TEST(Utf8ToWideChar, SequenceCutByEndOfTextIsDroppedWithoutReadingBeyond) {
    wchar_t out[8];
    const unsigned char text[] = {'a', 0xE2, 0x82, 0, 'z', 0};
    TraceCapture capture;
    EXPECT_EQ(utils::utf8ToWideChar(out, 8, text), 1u);
    EXPECT_STREQ(out, L"a");
    EXPECT_TRUE(capture.contains("utf8ToWideChar")) << capture.dump();
}

TEST(Utf8ToWideChar, WritesAtMostSizeMinusOneCharacters) {
    wchar_t out[8];
    const unsigned char text[] = "abcdef";
    EXPECT_EQ(utils::utf8ToWideChar(out, 3, text), 2u);
    EXPECT_STREQ(out, L"ab");
    EXPECT_EQ(utils::utf8ToWideChar(nullptr, 3, text), 0u);
    out[0] = L'q';
    EXPECT_EQ(utils::utf8ToWideChar(out, 0, text), 0u);
    EXPECT_EQ(out[0], L'q');
}

TEST(Utf8ToWideChar, AllOnesLeadTakesSixBytes) {
    wchar_t out[8];
    const unsigned char text[] = {0xFF, 0x81, 0x80, 0x80, 0x80, 0x80, 0x81, 'k', 0};
    EXPECT_EQ(utils::utf8ToWideChar(out, 8, text), 2u);
    // Six groups of six bits: 1, 0, 0, 0, 0, 1 -> bit 30 and bit 0.
    EXPECT_EQ(static_cast<uint32_t>(out[0]), 0x40000001u);
    EXPECT_EQ(out[1], L'k');
}

TEST(Utf8RoundTrip, EncodedTextDecodesToItself) {
    const wchar_t* text = L"Stra\u00dfe/\u65e5\u672c/\U0001F600.txt";
    utils::DynamicBuffer<unsigned char> buffer;
    utils::stringToUTF8(buffer, text);
    wchar_t back[64];
    utils::utf8ToWideChar(back, 64, buffer.get());
    EXPECT_STREQ(back, text);
}

// ---- time formats ------------------------------------------------------------------------

TEST(TimeFormats, MifOfZero) {
    char buffer[64];
    EXPECT_EQ(utils::timeToMIF(0, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "1970-01-01-00:00:00.000000");
}

TEST(TimeFormats, FifAndXmlAreUtc) {
    ScopedTimeZone zone("EST5");
    char buffer[64];
    EXPECT_EQ(utils::timeToFIF(1700000000L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "2023-11-14,22:13:20");
    EXPECT_EQ(utils::timeToXML(1700000000L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "2023-11-14T22:13:20");
}

TEST(TimeFormats, NullBufferOrZeroSizeGivesMinusOne) {
    char buffer[4] = {'x', 'x', 'x', 0};
    EXPECT_EQ(utils::timeToXML(0, nullptr, 32), -1);
    EXPECT_EQ(utils::timeToXML(0, buffer, 0), -1);
    EXPECT_EQ(utils::timeToFIF(0, nullptr, 32), -1);
    EXPECT_EQ(utils::timeToMIF(0, nullptr, 32), -1);
    EXPECT_EQ(utils::timeToSig(0, nullptr, 32), -1);
    EXPECT_STREQ(buffer, "xxx");
}

TEST(TimeFormats, SigOfZeroInUtc) {
    ScopedTimeZone zone("UTC");
    char buffer[64];
    EXPECT_EQ(utils::timeToSig(0, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "19700101000000_0");
}

TEST(TimeFormats, SigNumberIsLowWordOfTheDouble) {
    ScopedTimeZone zone("UTC");
    char buffer[64];
    // 1700000000.0 has the image 0x41D954FC40000000 (little-endian low word
    // 0x40000000), which "%u" prints on the 32-bit target.
    EXPECT_EQ(utils::timeToSig(1700000000L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "20231114221320_1073741824");
    // Small whole counts have an all-zero low word.
    EXPECT_EQ(utils::timeToSig(12345L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "19700101032545_0");
}

TEST(TimeFormats, SigCountsFromLocalEpoch) {
    // Five hours west of UTC: local 1970-01-01 00:00 is 18000 seconds after
    // the epoch, so the time 18000 counts 0.
    ScopedTimeZone zone("EST5");
    char buffer[64];
    EXPECT_EQ(utils::timeToSig(18000L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "19700101050000_0");
    // 1700018000 - 18000 = 1700000000.
    EXPECT_EQ(utils::timeToSig(1700018000L, buffer, sizeof(buffer)), 0);
    EXPECT_STREQ(buffer, "20231115031320_1073741824");
}

TEST(TimeFormats, SmallBufferIsClearedAndCut) {
    char buffer[8];
    std::memset(buffer, 'z', sizeof(buffer));
    EXPECT_EQ(utils::timeToSig(0, buffer, sizeof(buffer)), 0);
    EXPECT_EQ(std::strlen(buffer), 7u);
}

TEST(TimeFormats, LocalDatetimeXmlHasItsShape) {
    std::string now = utils::getLocalDatetimeXML();
    std::string group;
    EXPECT_EQ(utils::matchString("^([0-9]{4})-[0-9]{2}-[0-9]{2}T[0-9]{2}:[0-9]{2}:[0-9]{2}$", now.c_str(), group), 0)
        << now;
    EXPECT_GE(std::atoi(group.c_str()), 2020);
}

// ---- utils text helpers ---------------------------------------------------------------------

TEST(Wcsdup2, CopiesWithMallocAndNullStaysNull) {
    wchar_t* copy = utils::wcsdup2(L"abc");
    EXPECT_STREQ(copy, L"abc");
    std::free(copy);
    EXPECT_EQ(utils::wcsdup2(nullptr), nullptr);
}

TEST(TrimCopies, UseIsspaceAndLeaveTheArgument) {
    const std::string text = " \t a b \n";
    EXPECT_EQ(utils::trimLeft(text), "a b \n");
    EXPECT_EQ(utils::trimRight(text), " \t a b");
    EXPECT_EQ(utils::trimBoth(text), "a b");
    EXPECT_EQ(text, " \t a b \n");
    const std::wstring wide = L"\r x \v";
    EXPECT_EQ(utils::trimBoth(wide), L"x");
    EXPECT_EQ(utils::trimLeft(wide), L"x \v");
    EXPECT_EQ(utils::trimRight(wide), L"\r x");
    EXPECT_EQ(utils::trimBoth(std::string("   ")), "");
}

TEST(TrimInPlace, StringAndPointerForms) {
    std::string s = "\f\t a \r\n";
    EXPECT_EQ(&utils::trimBothInPlace(s), &s);
    EXPECT_EQ(s, "a");
    std::string l = "  x ";
    EXPECT_EQ(utils::trimLeftInPlace(l), "x ");
    std::string r = "  x ";
    EXPECT_EQ(utils::trimRightInPlace(r), "  x");
    std::wstring w = L"\v y \t";
    EXPECT_EQ(utils::trimBothInPlace(w), L"y");

    char narrow[] = " \t z \n";
    EXPECT_EQ(utils::trimBothInPlace(narrow), narrow);
    EXPECT_STREQ(narrow, "z");
    wchar_t wide[] = L"  q\t";
    EXPECT_STREQ(utils::trimLeftInPlace(wide), L"q\t");
    EXPECT_STREQ(utils::trimRightInPlace(wide), L"q");
    wchar_t blanks[] = L" \t ";
    EXPECT_STREQ(utils::trimBothInPlace(blanks), L"");
    EXPECT_EQ(utils::trimBothInPlace(static_cast<char*>(nullptr)), nullptr);
}

TEST(StartsEndsWith, FalseWhenSecondIsLonger) {
    EXPECT_TRUE(utils::startsWith("/etc/auto.master", "/etc"));
    EXPECT_FALSE(utils::startsWith("/etc", "/etc/auto.master"));
    EXPECT_TRUE(utils::endsWith("name.so", ".so"));
    EXPECT_FALSE(utils::endsWith("so", ".so"));
    EXPECT_TRUE(utils::startsWith("abc", ""));
    EXPECT_TRUE(utils::endsWith("abc", ""));
}

TEST(FormatString, FormatsAnyLength) {
    EXPECT_EQ(utils::formatString("%d-%s", 5, "x"), "5-x");
    std::string longText(5000, 'q');
    EXPECT_EQ(utils::formatString("[%s]", longText.c_str()), "[" + longText + "]");
    EXPECT_EQ(utils::formatString(""), "");
}

TEST(Split, LeadingAndRepeatedDelimitersGiveNoEmptyToken) {
    EXPECT_EQ(utils::split("  a  b ", " "), (std::vector<std::string>{"a", "b"}));
    EXPECT_EQ(utils::split("file,sun:/etc/auto.misc", ",:"),
              (std::vector<std::string>{"file", "sun", "/etc/auto.misc"}));
    EXPECT_TRUE(utils::split("", " ").empty());
    EXPECT_TRUE(utils::split("   ", " ").empty());
    EXPECT_EQ(utils::split("abc", ""), (std::vector<std::string>{"abc"}));
}

TEST(MatchString, FoundGivesFirstGroup) {
    std::string out;
    EXPECT_EQ(utils::matchString("^([a-z]+)-([0-9]+)$", "abc-12", out), 0);
    EXPECT_EQ(out, "abc");
}

TEST(MatchString, NoMatchGivesOne) {
    std::string out = "junk";
    EXPECT_EQ(utils::matchString("^([a-z]+)$", "ABC", out), 1);
    EXPECT_EQ(out, "");
}

TEST(MatchString, BadExpressionGivesFourAndLeavesOutEmpty) {
    std::string out = "junk";
    EXPECT_EQ(utils::matchString("(unclosed", "unclosed", out), 4);
    EXPECT_TRUE(out.empty());
}

TEST(MatchString, ExpressionWithoutGroupGivesEmptyOut) {
    std::string out = "junk";
    EXPECT_EQ(utils::matchString("b+", "abbc", out), 0);
    EXPECT_EQ(out, "");
}

TEST(ArgLists, OneLineText) {
    char a0[] = "prog";
    char a1[] = "-x";
    char a2[] = "file name";
    char* argv[] = {a0, a1, a2};
    EXPECT_EQ(utils::printArgList(3, argv), "prog -x file name");
    EXPECT_EQ(utils::printArgList(0, argv), "");
    wchar_t w0[] = L"prog";
    wchar_t w1[] = L"\u00e9";
    wchar_t* wargv[] = {w0, w1};
    EXPECT_EQ(utils::printWArgList(2, wargv), L"prog \u00e9");
}

TEST(EpochSeconds, IsTimeOfNull) {
    time_t before = std::time(nullptr);
    time_t now = utils::getCurrentEpochTimeSeconds();
    time_t after = std::time(nullptr);
    EXPECT_GE(now, before);
    EXPECT_LE(now, after);
}
