// Wildcard matchers, wide-string comparisons, path lists and the conversions.
#include <gtest/gtest.h>

#include <clocale>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

using utils::matchWildcard;

TEST(MatchWildcard, StarThenLiteralFindsLateRun) {
    EXPECT_TRUE(matchWildcard(L"*aab", L"aaab"));
    EXPECT_TRUE(matchWildcard("*aab", "aaab"));
}

TEST(MatchWildcard, QuestionMarkNeedsOneCharacter) {
    EXPECT_FALSE(matchWildcard(L"a?c", L"ac"));
    EXPECT_FALSE(matchWildcard("a?c", "ac"));
    EXPECT_TRUE(matchWildcard(L"a?c", L"abc"));
}

TEST(MatchWildcard, LoneStarMatchesAnything) {
    EXPECT_TRUE(matchWildcard(L"*", L"x"));
    EXPECT_TRUE(matchWildcard("**", "anything at all"));
}

TEST(MatchWildcard, TrailingStarsAreSkippedAtTextEnd) {
    EXPECT_TRUE(matchWildcard(L"abc*", L"abc"));
    EXPECT_TRUE(matchWildcard(L"abc**", L"abc"));
    EXPECT_FALSE(matchWildcard(L"abc*d", L"abc"));
}

TEST(MatchWildcard, CommonMasks) {
    EXPECT_TRUE(matchWildcard(L"*.txt", L"notes.txt"));
    EXPECT_FALSE(matchWildcard(L"*.txt", L"notes.txt.bak"));
    EXPECT_TRUE(matchWildcard(L"a*b", L"abxb"));
    EXPECT_TRUE(matchWildcard(L"*?c", L"abc"));
    EXPECT_FALSE(matchWildcard(L"abc", L"abd"));
    EXPECT_FALSE(matchWildcard(L"abc", L"abcd"));
    EXPECT_TRUE(matchWildcard(L"abc", L"abc"));
    EXPECT_TRUE(matchWildcard(L"lib*.so.?", L"libfoo.so.1"));
}

TEST(MatchWildcard, EmptyTextAndNullAreRefusedCleanly) {
    EXPECT_TRUE(matchWildcard(L"*", L""));
    EXPECT_FALSE(matchWildcard(L"?", L""));
    EXPECT_FALSE(matchWildcard(L"a", L""));
    EXPECT_FALSE(matchWildcard(L"*a*?", L"a"));
    EXPECT_FALSE(matchWildcard<wchar_t>(nullptr, L"a"));
    EXPECT_FALSE(matchWildcard<wchar_t>(L"a", nullptr));
}

TEST(MatchWildcard, StringObjectsAndIgnoreCaseLowerInPlace) {
    std::wstring mask = L"*.TXT";
    std::wstring text = L"Read.Me.txt";
    EXPECT_FALSE(matchWildcard(mask, text));
    EXPECT_TRUE(matchWildcard(mask, text, true));
    EXPECT_EQ(mask, L"*.txt");
    EXPECT_EQ(text, L"read.me.txt");
    std::string narrowMask = "A*";
    std::string narrowText = "abc";
    EXPECT_FALSE(matchWildcard(narrowMask, narrowText, false));
    EXPECT_EQ(narrowMask, "A*");
}

TEST(MatchWildcardEscaped, EscapedStarMatchesOnlyLiteralStar) {
    std::wstring mask = L"a\\*";
    std::wstring text = L"a*";
    EXPECT_TRUE((utils::matchWildcardEscapedSupport<wchar_t, std::wstring>(mask, text)));
    std::wstring mask2 = L"a\\*";
    std::wstring text2 = L"ab";
    EXPECT_FALSE((utils::matchWildcardEscapedSupport<wchar_t, std::wstring>(mask2, text2)));
}

TEST(MatchWildcardEscaped, ModifiesBothArguments) {
    std::string mask = "x\\?*";
    std::string text = "x?yz";
    EXPECT_TRUE((utils::matchWildcardEscapedSupport<char, std::string>(mask, text)));
    EXPECT_EQ(mask, std::string("x\x02*"));
    EXPECT_EQ(text, std::string("x\x02yz"));
    std::string mask2 = "x\\?";
    std::string text2 = "xa";
    EXPECT_FALSE((utils::matchWildcardEscapedSupport<char, std::string>(mask2, text2)));
    // An unescaped star keeps its wildcard meaning.
    std::string mask3 = "a*";
    std::string text3 = "a*b";
    EXPECT_TRUE((utils::matchWildcardEscapedSupport<char, std::string>(mask3, text3)));
}

TEST(WildCmp, GlobWithBacktracking) {
    EXPECT_TRUE(wildcmp(L"*.c", L"main.c", false));
    EXPECT_TRUE(wildcmp(L"a*b*c", L"aXbYbZc", false));
    EXPECT_FALSE(wildcmp(L"a*b", L"aXc", false));
    EXPECT_FALSE(wildcmp(L"abc", L"ab", false));
    EXPECT_TRUE(wildcmp(L"abc", L"ab", true));
    EXPECT_FALSE(wildcmp(L"ab", L"abc", true));
    EXPECT_FALSE(wildcmp(L"ABC", L"abc", false));
    EXPECT_TRUE(wildcasecmp(L"ABC", L"abc", false));
    EXPECT_TRUE(wildvccmp(L"A?C", L"abc", false));
    EXPECT_FALSE(wildvccmp(L"A?C", L"abc", true));
}

TEST(WildPathCmp, NonRecursivePatternDoesNotMatchTrailingSeparator) {
    EXPECT_FALSE(wildpathcmp(L"/usr", L"/usr/", false));
    EXPECT_TRUE(wildpathcmp(L"/usr", L"/usr/", true));
    EXPECT_TRUE(wildpathcmp(L"/usr", L"/usr", false));
}

TEST(WildPathCmp, StarReachingEndMatchesFinalSeparatorWithoutRecursive) {
    EXPECT_TRUE(wildpathcmp(L"/us?*r", L"/usxr/", false));
    EXPECT_FALSE(wildpathcmp(L"/us?*r", L"/usxr/lib", false));
    EXPECT_TRUE(wildpathcmp(L"/us?*r", L"/usxr/lib", true));
}

TEST(WildPathCmp, RecursiveCoversTheSubtree) {
    EXPECT_TRUE(wildpathcmp(L"/usr", L"/usr/lib/x", true));
    EXPECT_FALSE(wildpathcmp(L"/usr", L"/usr/lib/x", false));
    EXPECT_TRUE(wildpathcmp(L"/usr/", L"/usr/lib", true));
    EXPECT_TRUE(wildpathcmp(L"/", L"/etc", true));
    EXPECT_FALSE(wildpathcmp(L"/usr", L"/usrx", true));
}

TEST(WildPathCmp, TextEndingBeforePatternSeparator) {
    EXPECT_TRUE(wildpathcmp(L"/usr/", L"/usr", false));
    EXPECT_TRUE(wildpathcmp(L"/usr/*", L"/usr", false));
    EXPECT_FALSE(wildpathcmp(L"/usr/lib", L"/usr", false));
    EXPECT_TRUE(wildpathcmp(L"/u*/", L"/usr", false));
    // Stars skipped at the end of the text leave no room for the separator rule.
    EXPECT_FALSE(wildpathcmp(L"/usr*/", L"/usr", false));
}

TEST(WildPathCmp, StarsCrossSeparatorsAndCaseTwin) {
    EXPECT_TRUE(wildpathcmp(L"/home/*/.ssh", L"/home/a/b/.ssh", false));
    EXPECT_FALSE(wildpathcmp(L"/HOME/*", L"/home/a", false));
    EXPECT_TRUE(wildcasepathcmp(L"/HOME/*", L"/home/a", false));
    EXPECT_TRUE(wildvcpathcmp(L"/HOME", L"/home/a", true, false));
    EXPECT_FALSE(wildvcpathcmp(L"/HOME", L"/home/a", true, true));
}

TEST(WideStrings, CheckWildCardAndCaseComparisons) {
    EXPECT_TRUE(checkWildCard(L"a*"));
    EXPECT_TRUE(checkWildCard(L"a?"));
    EXPECT_FALSE(checkWildCard(L"abc"));
    EXPECT_FALSE(checkWildCard(nullptr));
    EXPECT_EQ(wcsvccmp(L"abc", L"ABC", false), 0);
    EXPECT_NE(wcsvccmp(L"abc", L"ABC", true), 0);
    EXPECT_EQ(wcsnvccmp(L"abcX", L"ABCy", 3, false), 0);
    EXPECT_NE(wcsnvccmp(L"abcX", L"ABCy", 3, true), 0);
}

TEST(CheckPathList, EmptyListNeverMatches) {
    std::vector<PathInfo> none;
    EXPECT_FALSE(checkPathList(L"/a", none, true, false));
}

TEST(CheckPathList, UsesEachEntrysRecursiveFlag) {
    std::vector<PathInfo> list;
    list.push_back(PathInfo(L"/data", false));
    EXPECT_TRUE(checkPathList(L"/data", list, true, false));
    EXPECT_FALSE(checkPathList(L"/data/sub", list, true, false));
    list.push_back(PathInfo(L"/opt", true));
    EXPECT_TRUE(checkPathList(L"/opt/x/y", list, true, false));
    EXPECT_TRUE(checkPathList(L"/OPT/x", list, false, false));
    EXPECT_FALSE(checkPathList(L"/OPT/x", list, true, false));
}

TEST(CheckPathList, OnlyRecursivePassesOverPlainEntries) {
    std::vector<PathInfo> list;
    list.push_back(PathInfo(L"/data", false));
    EXPECT_FALSE(checkPathList(L"/data", list, true, true));
    list.push_back(PathInfo(nullptr, true));
    list.push_back(PathInfo(L"/data", true));
    EXPECT_TRUE(checkPathList(L"/data/sub", list, true, true));
}

TEST(GetPathName, JoinsWithOneSeparator) {
    wchar_t* a = getPathName(L"/tmp", L"f");
    wchar_t* b = getPathName(L"/tmp/", L"f");
    wchar_t* c = getPathName(L"", L"f");
    EXPECT_STREQ(a, L"/tmp/f");
    EXPECT_STREQ(b, L"/tmp/f");
    EXPECT_STREQ(c, L"f");
    EXPECT_EQ(getPathName(nullptr, L"f"), nullptr);
    EXPECT_EQ(getPathName(L"/tmp", nullptr), nullptr);
    delete[] a;
    delete[] b;
    delete[] c;
}

TEST(Conversions, WideToMultibyteAndBack) {
    EXPECT_EQ(utils::myWcsToMbsString(nullptr), nullptr);
    EXPECT_EQ(utils::myMbsToWcsString(nullptr), nullptr);
    char* narrow = utils::myWcsToMbsString(L"/tmp/abc");
    ASSERT_NE(narrow, nullptr);
    EXPECT_STREQ(narrow, "/tmp/abc");
    wchar_t* wide = utils::myMbsToWcsString("/tmp/abc");
    ASSERT_NE(wide, nullptr);
    EXPECT_STREQ(wide, L"/tmp/abc");
    delete[] narrow;
    delete[] wide;
}

TEST(Conversions, FailedConversionGivesEmptyNotNull) {
    const char* old = setlocale(LC_CTYPE, nullptr);
    std::string saved = old != nullptr ? old : "C";
    setlocale(LC_CTYPE, "C");
    // U+00E9 has no form in the C locale's 7-bit character set.
    char* narrow = utils::myWcsToMbsString(L"caf\u00e9");
    ASSERT_NE(narrow, nullptr);
    EXPECT_STREQ(narrow, "");
    wchar_t* wide = utils::myMbsToWcsString("caf\xc3\xa9");
    ASSERT_NE(wide, nullptr);
    EXPECT_STREQ(wide, L"");
    delete[] narrow;
    delete[] wide;
    setlocale(LC_CTYPE, saved.c_str());
}

TEST(StringHelpers, LowerAndReplaceAll) {
    std::string s = "MiXeD";
    utils::stringToLower(s);
    EXPECT_EQ(s, "mixed");
    std::wstring w = L"ABC";
    utils::stringToLower(w);
    EXPECT_EQ(w, L"abc");
    std::string t = "aXa";
    utils::replaceAllStrings(t, std::string("a"), std::string("aa"));
    EXPECT_EQ(t, "aaXaa");
    std::wstring u = L"x--y--";
    utils::replaceAllStrings(u, std::wstring(L"--"), std::wstring(L"-"));
    EXPECT_EQ(u, L"x-y-");
    std::string v = "abc";
    utils::replaceAllStrings(v, std::string(""), std::string("z"));
    EXPECT_EQ(v, "abc");
}

TEST(TickCount, AdvancesInMilliseconds) {
    unsigned int a = getTickCount();
    struct timespec pause = {0, 30 * 1000 * 1000};
    nanosleep(&pause, nullptr);
    unsigned int b = utils::getTickCount();
    EXPECT_GE(b - a, 25u);
    EXPECT_LT(b - a, 5000u);
}
