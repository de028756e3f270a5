// Known-checksum sets and mask sets: FileHashBlackBox, FileMaskLookup and the
// StaticHashTable behind it.
#include "fscanner/fscommon/filehash.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>
#include <vector>

#include "support/testsupport.h"

// A FileMaskLookup keeps its copied masks and hash tables for the life of the
// process by design; the leak checker is told so for exactly those.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:FileMaskLookup::insert\n"
           "leak:FileMaskLookup::commit_transaction\n";
}

namespace {

FileChecksumInfo checksums(uint32_t flags, unsigned int crc, unsigned int q32, const char* md5) {
    FileChecksumInfo info;
    info.valid = true;
    info.flags = flags;
    info.crc32 = crc;
    info.q32 = q32;
    if (md5 != nullptr) info.md5 = char2md5(md5);
    return info;
}

const char* kMd5Abc = "900150983cd24fb0d6963f7d28e17f72";
const char* kMd5Empty = "d41d8cd98f00b204e9800998ecf8427e";

}  // namespace

// --- FileHashBlackBox -------------------------------------------------------------------

TEST(FileHashBlackBox, NewSetIsEmpty) {
    FileHashBlackBox set;
    EXPECT_TRUE(set.empty());
    EXPECT_EQ(0u, set.size());
    EXPECT_FALSE(set.find(checksums(0x7, 0, 0, kMd5Empty)));
}

TEST(FileHashBlackBox, EveryInsertCountsDuplicatesIncluded) {
    FileHashBlackBox set;
    set.insert_crc32(1);
    set.insert_crc32(1);
    set.insert_q32(2);
    set.insert_md5(char2md5(kMd5Abc));
    set.insert_sha256(u_int256());
    EXPECT_FALSE(set.empty());
    EXPECT_EQ(5u, set.size());
}

TEST(FileHashBlackBox, FlagsZeroIsFalseEvenWithMatchingValues) {
    FileHashBlackBox set;
    set.insert_crc32(0xCBF43926u);
    set.insert_q32(0xCBF43926u);
    set.insert_md5(char2md5(kMd5Abc));
    EXPECT_FALSE(set.find(checksums(0, 0xCBF43926u, 0xCBF43926u, kMd5Abc)));
}

TEST(FileHashBlackBox, Crc32MatchesOnlyWhenAskedFor) {
    FileHashBlackBox set;
    set.insert_crc32(10);
    set.insert_crc32(0xCBF43926u);
    EXPECT_TRUE(set.find(checksums(FILE_CHECKSUM_CRC32, 0xCBF43926u, 0, nullptr)));
    EXPECT_FALSE(set.find(checksums(FILE_CHECKSUM_CRC32, 11, 0, nullptr)));
    // The CRC32 value is there, but only Q32 is asked for.
    EXPECT_FALSE(set.find(checksums(FILE_CHECKSUM_Q32, 0xCBF43926u, 5, nullptr)));
}

TEST(FileHashBlackBox, Q32ValuesAreSeparateFromCrc32Values) {
    FileHashBlackBox set;
    set.insert_q32(77);
    EXPECT_TRUE(set.find(checksums(FILE_CHECKSUM_Q32, 0, 77, nullptr)));
    EXPECT_FALSE(set.find(checksums(FILE_CHECKSUM_CRC32, 77, 0, nullptr)));
    EXPECT_TRUE(set.find(checksums(FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32, 1, 77, nullptr)));
}

TEST(FileHashBlackBox, Md5ComparesAllSixteenBytes) {
    FileHashBlackBox set;
    set.insert_md5(char2md5(kMd5Empty));
    set.insert_md5(char2md5(kMd5Abc));
    EXPECT_TRUE(set.find(checksums(FILE_CHECKSUM_MD5, 0, 0, kMd5Abc)));
    // Differs in the last byte only.
    EXPECT_FALSE(set.find(checksums(FILE_CHECKSUM_MD5, 0, 0, "900150983cd24fb0d6963f7d28e17f73")));
    // MD5 equal but not asked for.
    EXPECT_FALSE(set.find(checksums(FILE_CHECKSUM_CRC32, 0, 0, kMd5Abc)));
}

TEST(FileHashBlackBox, MissOnCrcGoesOnToMd5) {
    FileHashBlackBox set;
    set.insert_crc32(1);
    set.insert_md5(char2md5(kMd5Abc));
    EXPECT_TRUE(set.find(checksums(0x7, 2, 3, kMd5Abc)));
}

TEST(FileHashBlackBox, Sha256ValuesNeverMatch) {
    FileChecksumInfo info;
    info.flags = 0xF;
    ASSERT_TRUE(char2sha256("ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad",
                            info.sha256));
    FileHashBlackBox set;
    set.insert_sha256(info.sha256);
    EXPECT_EQ(1u, set.size());
    EXPECT_FALSE(set.empty());
    EXPECT_FALSE(set.find(info));
    info.flags = FILE_CHECKSUM_SHA256;
    EXPECT_FALSE(set.find(info));
}

TEST(FileHashBlackBox, FindsSumsOfARealFile) {
    testsupport::TempDir dir;
    std::string path = dir.write("f", "123456789");
    FileChecksumInfo info;
    info.flags = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5;
    ASSERT_EQ(0, computeFileChecksumInfo(info, path.c_str()));
    FileHashBlackBox byCrc;
    byCrc.insert_crc32(0xCBF43926u);
    EXPECT_TRUE(byCrc.find(info));
    FileHashBlackBox byMd5;
    byMd5.insert_md5(char2md5("25f9e794323b453885f5181f1b624d0b"));  // md5("123456789")
    EXPECT_TRUE(byMd5.find(info));
}

// --- FileMaskLookup: insert ------------------------------------------------------------

TEST(FileMaskLookup, InsertReturnsShapeBits) {
    FileMaskLookup set;
    EXPECT_EQ(1, set.insert(L"abc"));
    EXPECT_EQ(2, set.insert(L"*abc"));
    EXPECT_EQ(4, set.insert(L"abc*"));
    EXPECT_EQ(8, set.insert(L"a?c"));
    EXPECT_EQ(8, set.insert(L"*x*"));
    EXPECT_EQ(8, set.insert(L"a*c"));
    EXPECT_EQ(8, set.insert(L"?"));
    EXPECT_EQ(8, set.insert(L"*?"));
    EXPECT_EQ(8, set.insert(L"**"));
    EXPECT_EQ(9, set.size());
}

TEST(FileMaskLookup, EmptyMaskIsRefusedButCounted) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert(L""));
    EXPECT_EQ(1, set.size());
    set.commit_transaction(true);
    EXPECT_FALSE(set.find(L""));
    EXPECT_FALSE(set.find(L"a"));
}

TEST(FileMaskLookup, NullMaskIsRefusedButCounted) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert(nullptr));
    EXPECT_EQ(1, set.size());
}

TEST(FileMaskLookup, BareStarMatchesEveryNameIncludingEmpty) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert(L"*"));
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"anything.txt"));
    EXPECT_TRUE(set.find(L""));
    EXPECT_TRUE(set.find(L"*"));
}

TEST(FileMaskLookup, AfterBareStarInsertsReturnZeroAndAreNotCounted) {
    FileMaskLookup set;
    EXPECT_EQ(1, set.insert(L"abc"));
    EXPECT_EQ(0, set.insert(L"*"));
    EXPECT_EQ(2, set.size());  // the star itself was counted
    EXPECT_EQ(0, set.insert(L"def"));
    EXPECT_EQ(0, set.insert(L"*x*"));
    EXPECT_EQ(0, set.insert(L""));
    EXPECT_EQ(0, set.insert(L"*"));
    EXPECT_EQ(2, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"zzz"));
}

TEST(FileMaskLookup, FindBeforeCommitIsFalse) {
    FileMaskLookup set;
    set.insert(L"abc");
    set.insert(L"*");
    EXPECT_FALSE(set.find(L"abc"));
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"abc"));
}

// --- FileMaskLookup: find by shape -----------------------------------------------------

TEST(FileMaskLookup, PlainNameMatchesExactlyOnly) {
    FileMaskLookup set;
    set.insert(L"report.txt");
    set.insert(L"a");
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"report.txt"));
    EXPECT_TRUE(set.find(L"a"));
    EXPECT_FALSE(set.find(L"report.tx"));
    EXPECT_FALSE(set.find(L"report.txt2"));
    EXPECT_FALSE(set.find(L"xreport.txt"));
    EXPECT_FALSE(set.find(L""));
}

TEST(FileMaskLookup, LeftWildcardMatchesTailsIncludingTheTailItself) {
    FileMaskLookup set;
    set.insert(L"*abc");
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"abc"));
    EXPECT_TRUE(set.find(L"xabc"));
    EXPECT_TRUE(set.find(L"longer.name.abc"));
    EXPECT_FALSE(set.find(L"abcx"));
    EXPECT_FALSE(set.find(L"bc"));
    EXPECT_FALSE(set.find(L"ab"));
}

TEST(FileMaskLookup, RightWildcardMatchesHeadsIncludingTheHeadItself) {
    FileMaskLookup set;
    set.insert(L"abc*");
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"abc"));
    EXPECT_TRUE(set.find(L"abcdef"));
    EXPECT_FALSE(set.find(L"xabc"));
    EXPECT_FALSE(set.find(L"ab"));
}

TEST(FileMaskLookup, RightWildcardLeavesTheNameAsItWas) {
    FileMaskLookup set;
    set.insert(L"lib*");
    set.insert(L"x*");
    set.commit_transaction(true);
    wchar_t name[] = L"libfoo.so";
    EXPECT_TRUE(set.find(name));
    EXPECT_STREQ(L"libfoo.so", name);
    wchar_t other[] = L"nothing";
    EXPECT_FALSE(set.find(other));
    EXPECT_STREQ(L"nothing", other);
    // A name in read-only memory is fine too.
    EXPECT_TRUE(set.find(L"library"));
}

TEST(FileMaskLookup, HardMasksAreTriedByWildcardCompare) {
    FileMaskLookup set;
    EXPECT_EQ(8, set.insert(L"a?c"));
    EXPECT_EQ(8, set.insert(L"*x*"));
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"abc"));
    EXPECT_TRUE(set.find(L"azc"));
    EXPECT_FALSE(set.find(L"ac"));
    EXPECT_FALSE(set.find(L"abbc"));
    EXPECT_TRUE(set.find(L"x"));
    EXPECT_TRUE(set.find(L"boxes"));
    EXPECT_FALSE(set.find(L"boy"));
}

TEST(FileMaskLookup, HardMasksFollowTheCaseFlag) {
    FileMaskLookup sensitive;
    sensitive.insert(L"A?C");
    sensitive.commit_transaction(true);
    EXPECT_FALSE(sensitive.find(L"abc"));
    EXPECT_TRUE(sensitive.find(L"AbC"));

    FileMaskLookup insensitive;
    insensitive.insert(L"A?C");
    insensitive.commit_transaction(false);
    EXPECT_TRUE(insensitive.find(L"abc"));
}

TEST(FileMaskLookup, MixedShapesInOneSet) {
    FileMaskLookup set;
    set.insert(L"core");
    set.insert(L"*.log");
    set.insert(L"tmp*");
    set.insert(L"*.b?k");
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"core"));
    EXPECT_TRUE(set.find(L"server.log"));
    EXPECT_TRUE(set.find(L"tmpfile"));
    EXPECT_TRUE(set.find(L"old.bak"));
    EXPECT_FALSE(set.find(L"cores"));
    EXPECT_FALSE(set.find(L"server.log.1"));
    EXPECT_FALSE(set.find(L"file.tmp"));
    EXPECT_FALSE(set.find(L"old.bk"));
}

TEST(FileMaskLookup, TwoEqualMasksAreBothStoredAndFound) {
    FileMaskLookup set;
    EXPECT_EQ(1, set.insert(L"same"));
    EXPECT_EQ(1, set.insert(L"same"));
    EXPECT_EQ(2, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"same"));
}

TEST(FileMaskLookup, MasksInsertedAfterCommitStayOutOfTheTables) {
    FileMaskLookup set;
    set.insert(L"first");
    set.commit_transaction(true);
    EXPECT_EQ(1, set.insert(L"second"));
    EXPECT_EQ(2, set.insert(L"*tail"));
    EXPECT_EQ(3, set.size());
    EXPECT_TRUE(set.find(L"first"));
    EXPECT_FALSE(set.find(L"second"));
    EXPECT_FALSE(set.find(L"xtail"));
    // The hard list needs no table, so a late hard mask is still tried.
    EXPECT_EQ(8, set.insert(L"s?cond"));
    EXPECT_TRUE(set.find(L"second"));
}

TEST(FileMaskLookup, PlainTableIgnoringCaseStillHashesCase) {
    // The hash does not fold case; an equal name in the same case is found
    // whatever the flag.
    FileMaskLookup set;
    set.insert(L"Readme");
    set.commit_transaction(false);
    EXPECT_TRUE(set.find(L"Readme"));
}

TEST(FileMaskLookup, MaskTooLongForTheLengthBlockIsRefusedButCounted) {
    testsupport::TraceCapture trace;
    FileMaskLookup set;
    std::wstring plain(4096, L'p');
    EXPECT_EQ(0, set.insert(plain.c_str()));
    EXPECT_EQ(1, set.size());
    std::wstring fitting(4095, L'p');
    EXPECT_EQ(1, set.insert(fitting.c_str()));
    // A leading or trailing star does not count: 4095 fixed characters fit.
    std::wstring left = L"*" + std::wstring(4095, L'l');
    EXPECT_EQ(2, set.insert(left.c_str()));
    std::wstring right = std::wstring(4096, L'r') + L"*";
    EXPECT_EQ(0, set.insert(right.c_str()));
    // Hard masks never index the length block.
    std::wstring hard = L"h?" + std::wstring(5000, L'h');
    EXPECT_EQ(8, set.insert(hard.c_str()));
    EXPECT_EQ(5, set.size());
    EXPECT_TRUE(trace.contains("FileMaskLookup::insert")) << trace.dump();

    set.commit_transaction(true);
    EXPECT_TRUE(set.find(fitting.c_str()));
    EXPECT_FALSE(set.find(plain.c_str()));
    EXPECT_TRUE(set.find((L"xx" + std::wstring(4095, L'l')).c_str()));
    std::wstring hardName = L"hx" + std::wstring(5000, L'h');
    EXPECT_TRUE(set.find(hardName.c_str()));
}

TEST(FileMaskLookup, VeryLongNamesAreSearchedSafely) {
    FileMaskLookup set;
    set.insert(L"abc");
    set.insert(L"*.txt");
    set.insert(L"pre*");
    set.commit_transaction(true);
    std::wstring longTxt = std::wstring(6000, L'n') + L".txt";
    EXPECT_TRUE(set.find(longTxt.c_str()));
    std::wstring longPre = L"pre" + std::wstring(6000, L'n');
    EXPECT_TRUE(set.find(longPre.c_str()));
    std::wstring longOther = std::wstring(6000, L'n');
    EXPECT_FALSE(set.find(longOther.c_str()));
}

TEST(FileMaskLookup, FindOfNullIsFalseUnlessEverythingMatches) {
    FileMaskLookup set;
    set.insert(L"abc");
    set.commit_transaction(true);
    EXPECT_FALSE(set.find(nullptr));
}

// --- FileMaskLookup: insert_stringlist -----------------------------------------------------

TEST(FileMaskLookup, StringListInsertsEveryQuotedString) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert_stringlist(L"\"core\", \"*.log\" \"tmp*\",\"a?c\""));
    EXPECT_EQ(4, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"core"));
    EXPECT_TRUE(set.find(L"x.log"));
    EXPECT_TRUE(set.find(L"tmpdir"));
    EXPECT_TRUE(set.find(L"abc"));
    EXPECT_FALSE(set.find(L","));
}

TEST(FileMaskLookup, StringListIgnoresTextOutsideQuotes) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert_stringlist(L"core, x.log"));
    EXPECT_EQ(0, set.size());
    set.commit_transaction(true);
    EXPECT_FALSE(set.find(L"core"));
}

TEST(FileMaskLookup, StringListEmptyStringIsInsertedAndRefused) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert_stringlist(L"\"\" \"a\""));
    EXPECT_EQ(2, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"a"));
}

TEST(FileMaskLookup, StringListUnclosedQuoteTakesTheRest) {
    FileMaskLookup set;
    EXPECT_EQ(0, set.insert_stringlist(L"\"one\" \"two"));
    EXPECT_EQ(2, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"one"));
    EXPECT_TRUE(set.find(L"two"));
}

TEST(FileMaskLookup, StringListWithStarMatchesAll) {
    FileMaskLookup set;
    set.insert_stringlist(L"\"a\" \"*\" \"b\"");
    EXPECT_EQ(2, set.size());
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"whatever"));
}

TEST(FileMaskLookup, StringListSkipsStringsTooLongForScratch) {
    testsupport::TraceCapture trace;
    FileMaskLookup set;
    std::wstring list = L"\"" + std::wstring(4096, L'x') + L"\" \"short\"";
    EXPECT_EQ(0, set.insert_stringlist(list.c_str()));
    EXPECT_EQ(1, set.size());
    EXPECT_TRUE(trace.contains("insert_stringlist")) << trace.dump();
    set.commit_transaction(true);
    EXPECT_TRUE(set.find(L"short"));
    EXPECT_EQ(0, set.insert_stringlist(nullptr));
}

// --- StaticHashTable ------------------------------------------------------------------------

namespace {

std::vector<wchar_t*> makeStrings(std::vector<std::wstring>& storage) {
    std::vector<wchar_t*> out;
    for (std::wstring& s : storage) out.push_back(&s[0]);
    return out;
}

}  // namespace

TEST(StaticHashTable, SizeIsPowerOfTwoAboveThreeTimesCount) {
    struct Case {
        size_t strings;
        int size;
    } cases[] = {{0, 16}, {1, 16}, {5, 16}, {6, 32}, {10, 32}, {11, 64}, {21, 64}, {22, 128}};
    for (const Case& c : cases) {
        std::vector<std::wstring> storage;
        for (size_t i = 0; i < c.strings; ++i) storage.push_back(L"s" + std::to_wstring(i));
        StaticHashTable table(makeStrings(storage), true);
        EXPECT_EQ(c.size, table.getSize()) << c.strings;
        EXPECT_EQ(static_cast<int>(c.strings), table.getCount()) << c.strings;
    }
}

TEST(StaticHashTable, FindsEveryStringAndNothingElse) {
    std::vector<std::wstring> storage;
    for (int i = 0; i < 200; ++i) storage.push_back(L"name" + std::to_wstring(i));
    StaticHashTable table(makeStrings(storage), true);
    for (int i = 0; i < 200; ++i) {
        EXPECT_TRUE(table.hash_find(storage[i].c_str())) << i;
        EXPECT_EQ(i, table.hash_index(storage[i].c_str())) << i;
    }
    EXPECT_FALSE(table.hash_find(L"name200"));
    EXPECT_FALSE(table.hash_find(L""));
    EXPECT_FALSE(table.hash_find(nullptr));
}

TEST(StaticHashTable, EqualStringsAreBothInsertedAndTheFirstIsFound) {
    std::vector<std::wstring> storage = {L"dup", L"dup", L"other"};
    StaticHashTable table(makeStrings(storage), true);
    EXPECT_EQ(3, table.getCount());
    EXPECT_EQ(0, table.hash_index(L"dup"));
}

TEST(StaticHashTable, ScatterDoublesAndAddsPerCharacter) {
    EXPECT_EQ(0u, StaticHashTable::hash_scatter(L""));
    const unsigned int a = StaticHashTable::hash_scatter(L"A");
    const unsigned int b = StaticHashTable::hash_scatter(L"B");
    EXPECT_EQ(a * 2u + b, StaticHashTable::hash_scatter(L"AB"));
    EXPECT_EQ((a * 2u + b) * 2u + a, StaticHashTable::hash_scatter(L"ABA"));
    EXPECT_NE(a, b);
}

TEST(StaticHashTable, OnlyLowEightBitsOfACharacterCount) {
    EXPECT_EQ(StaticHashTable::hash_scatter(L"A"), StaticHashTable::hash_scatter(L"\u0141"));
    EXPECT_EQ(StaticHashTable::hash_scatter(L"xA"), StaticHashTable::hash_scatter(L"x\u0241"));
}

TEST(StaticHashTable, ScatterDoesNotFoldCase) {
    EXPECT_NE(StaticHashTable::hash_scatter(L"abc"), StaticHashTable::hash_scatter(L"ABC"));
}

TEST(StaticHashTable, TableIgnoringCaseFindsOtherCaseOnlyWhereTheProbeLands) {
    std::vector<std::wstring> storage = {L"abc"};
    StaticHashTable table(makeStrings(storage), false);
    EXPECT_TRUE(table.hash_find(L"abc"));
    const unsigned int mask = static_cast<unsigned int>(table.getSize() - 1);
    const unsigned int home = StaticHashTable::hash_scatter(L"abc") & mask;
    const unsigned int other = StaticHashTable::hash_scatter(L"ABC");
    // "ABC" is looked for at its own home slot, then from seed + h + 1 on;
    // the first free slot ends the search.
    const bool reachable = (other & mask) == home ||
                           ((static_cast<unsigned int>(table.getSeed()) + other + 1) & mask) == home;
    EXPECT_EQ(reachable, table.hash_find(L"ABC"));
}

TEST(StaticHashTable, SeedComesFromRandSeededWithTheClock) {
    const time_t before = time(nullptr);
    std::vector<std::wstring> storage = {L"x"};
    StaticHashTable table(makeStrings(storage), true);
    const time_t after = time(nullptr);
    bool matched = false;
    for (time_t t = before; t <= after; ++t) {
        srand(static_cast<unsigned int>(t));
        if (rand() == table.getSeed()) matched = true;
    }
    EXPECT_TRUE(matched);
}

TEST(StaticHashTable, InsertByHandRefusesBadIndexAndFullTable) {
    std::vector<std::wstring> storage = {L"only"};
    StaticHashTable table(makeStrings(storage), true);
    table.hash_insert(-1);
    table.hash_insert(1);
    EXPECT_EQ(1, table.getCount());
    for (int i = 0; i < 40; ++i) table.hash_insert(0);
    EXPECT_EQ(16, table.getCount());  // every slot taken, then refused
    EXPECT_TRUE(table.hash_find(L"only"));
    EXPECT_FALSE(table.hash_find(L"none"));  // a full table ends its probe
}
