// Wildcard matchers, wide-string comparisons, path lists and the conversions.
#include <gtest/gtest.h>

#include <clocale>
#include <cstring>
#include <cwctype>
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

namespace {

// The matcher's steps, one by one, with one remembered position.  The steps
// can run the text past its end in two places; there the answer is the one a
// clean stop gives: a "?" that finds the end fails, and mask and text ending
// together match.
bool stepByStep(const std::string& maskText, const std::string& textText) {
    const char* mask = maskText.c_str();
    const char* text = textText.c_str();
    long m = 0, t = 0, restartMask = -1, restartText = -1;
step1:
    if (mask[m] == '*') {
        while (mask[m] == '*') ++m;
        if (mask[m] == 0) return true;
        restartMask = m;
        restartText = t;
        if (mask[m] == '?') {
            if (text[t] == 0) return false;
        } else {
            while (text[t] != mask[m]) {
                if (text[t] == 0) return false;
                ++t;
                restartText = t;
            }
        }
        goto step3;
    }
step2: {
        char c = mask[m], d = text[t];
        if (d == 0 && c == '?') return false;
        if (d == 0 && c == 0) return true;
        if (c == d || c == '?') goto step3;
        if (restartMask < 0) return false;
        if (m == restartMask) {
            if (d == 0) return false;
            ++t;
            goto step1;
        }
        if (d == mask[restartMask]) {
            m = restartMask + 1;
            if (d == 0) return false;
            ++t;
            goto step1;
        }
        if (text[restartText] == 0) return false;
        ++restartText;
        t = restartText;
        m = restartMask;
        goto step2;
    }
step3:
    ++m;
    ++t;
    if (text[t] == 0) {
        while (mask[m] == '*') ++m;
        return mask[m] == 0;
    }
    goto step1;
}

}  // namespace

TEST(MatchWildcard, AgreesWithTheStepsOnEveryShortMaskAndText) {
    // Every mask of up to five characters over "a", "b", "*", "?" against
    // every text of one to six characters over "a", "b", in both widths.
    const char alphabet[] = "ab*?";
    size_t compared = 0, disagreements = 0, matches = 0;
    for (int maskLength = 0; maskLength <= 5; ++maskLength) {
        long maskCount = 1;
        for (int i = 0; i < maskLength; ++i) maskCount *= 4;
        for (long mi = 0; mi < maskCount; ++mi) {
            std::string mask;
            for (long x = mi, i = 0; i < maskLength; ++i, x /= 4) mask += alphabet[x % 4];
            const std::wstring wideMask(mask.begin(), mask.end());
            for (int textLength = 1; textLength <= 6; ++textLength) {
                for (long ti = 0; ti < (1L << textLength); ++ti) {
                    std::string text;
                    for (int i = 0; i < textLength; ++i) text += ((ti >> i) & 1) ? 'b' : 'a';
                    const std::wstring wideText(text.begin(), text.end());
                    const bool expected = stepByStep(mask, text);
                    const bool narrow = matchWildcard(mask.c_str(), text.c_str());
                    const bool wide = matchWildcard(wideMask.c_str(), wideText.c_str());
                    ++compared;
                    if (expected) ++matches;
                    if (narrow != expected || wide != expected) {
                        if (++disagreements <= 10)
                            ADD_FAILURE() << "mask '" << mask << "' text '" << text << "': steps " << expected
                                          << ", narrow " << narrow << ", wide " << wide;
                    }
                }
            }
        }
    }
    EXPECT_EQ(0u, disagreements);
    EXPECT_EQ(1365u * 126u, compared);
    EXPECT_GT(matches, 0u);
    EXPECT_LT(matches, compared);
    // Where the steps would take a "?" past the end of the text, no match.
    EXPECT_FALSE(matchWildcard("*a?", "aaa"));
    EXPECT_TRUE(matchWildcard("*a?", "aab"));
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

namespace {

// The glob steps: characters one by one until the first "*"; then at each
// "*" remember the pattern behind it and the text one further, and on a
// mismatch go back there, moving the text on by one.
bool globSteps(const wchar_t* pattern, const wchar_t* text, bool prefixOk, bool foldCase) {
    auto same = [foldCase](wchar_t a, wchar_t b) { return foldCase ? towlower(a) == towlower(b) : a == b; };
    const wchar_t* rememberedPattern = nullptr;
    const wchar_t* rememberedText = nullptr;
    while (*text != 0 && *pattern != L'*') {
        if (!same(*pattern, *text) && *pattern != L'?') return false;
        ++pattern;
        ++text;
    }
    while (*text != 0) {
        if (*pattern == L'*') {
            if (*++pattern == 0) return true;
            rememberedPattern = pattern;
            rememberedText = text + 1;
        } else if (same(*pattern, *text) || *pattern == L'?') {
            ++pattern;
            ++text;
        } else {
            pattern = rememberedPattern;
            text = rememberedText++;
        }
    }
    while (*pattern == L'*') ++pattern;
    return *pattern == 0 || prefixOk;
}

}  // namespace

TEST(WildCmp, AgreesWithTheGlobStepsOnEveryShortPatternAndText) {
    // Patterns of up to five characters over "a", "B", "*", "?"; texts of up
    // to six characters over "A", "b"; both prefix modes; both case twins.
    const wchar_t alphabet[] = L"aB*?";
    size_t compared = 0, disagreements = 0, caseOnly = 0;
    for (int patternLength = 0; patternLength <= 5; ++patternLength) {
        long patternCount = 1;
        for (int i = 0; i < patternLength; ++i) patternCount *= 4;
        for (long pi = 0; pi < patternCount; ++pi) {
            std::wstring pattern;
            for (long x = pi, i = 0; i < patternLength; ++i, x /= 4) pattern += alphabet[x % 4];
            for (int textLength = 0; textLength <= 6; ++textLength) {
                for (long ti = 0; ti < (1L << textLength); ++ti) {
                    std::wstring text;
                    for (int i = 0; i < textLength; ++i) text += ((ti >> i) & 1) ? L'b' : L'A';
                    for (bool prefixOk : {false, true}) {
                        const bool exact = globSteps(pattern.c_str(), text.c_str(), prefixOk, false);
                        const bool folded = globSteps(pattern.c_str(), text.c_str(), prefixOk, true);
                        const bool gotExact = wildcmp(pattern.c_str(), text.c_str(), prefixOk);
                        const bool gotFolded = wildcasecmp(pattern.c_str(), text.c_str(), prefixOk);
                        compared += 2;
                        if (folded && !exact) ++caseOnly;
                        if (gotExact != exact || gotFolded != folded) {
                            if (++disagreements <= 10)
                                ADD_FAILURE() << "pattern '" << std::string(pattern.begin(), pattern.end())
                                              << "' text '" << std::string(text.begin(), text.end())
                                              << "' prefixOk " << prefixOk << ": steps " << exact << "/" << folded
                                              << ", got " << gotExact << "/" << gotFolded;
                        }
                    }
                }
            }
        }
    }
    EXPECT_EQ(0u, disagreements);
    EXPECT_EQ(1365u * 127u * 4u, compared);
    EXPECT_GT(caseOnly, 0u);  // the case twins do differ somewhere
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

namespace {

// The path rules: the glob steps, where a mismatch with the pattern at its end
// may still match at a separator, and a text that ends before the pattern may
// match a pattern that goes on with only "/" or "/*".
bool pathSteps(const wchar_t* pattern, const wchar_t* text, bool recursive, bool foldCase) {
    auto same = [foldCase](wchar_t a, wchar_t b) { return foldCase ? towlower(a) == towlower(b) : a == b; };
    const wchar_t* const textStart = text;
    const wchar_t* rememberedPattern = nullptr;
    const wchar_t* rememberedText = nullptr;
    while (*text != 0 && *pattern != L'*') {
        if (*pattern != 0 && (same(*pattern, *text) || *pattern == L'?')) {
            ++pattern;
            ++text;
            continue;
        }
        if (*pattern != 0 || !recursive) return false;
        return *text == L'/' || (text > textStart && text[-1] == L'/');
    }
    while (*text != 0) {
        if (*pattern == L'*') {
            if (*++pattern == 0) return true;
            rememberedPattern = pattern;
            rememberedText = text + 1;
        } else if (*pattern != 0 && (same(*pattern, *text) || *pattern == L'?')) {
            ++pattern;
            ++text;
        } else {
            if (*pattern == 0 && *text == L'/' && (recursive || text[1] == 0)) return true;
            pattern = rememberedPattern;
            text = rememberedText++;
        }
    }
    bool skipped = false;
    while (*pattern == L'*') {
        ++pattern;
        skipped = true;
    }
    if (*pattern == 0) return true;
    if (skipped) return false;
    return *pattern == L'/' && (pattern[1] == 0 || (pattern[1] == L'*' && pattern[2] == 0));
}

}  // namespace

TEST(WildPathCmp, AgreesWithThePathRulesOnEveryShortPatternAndText) {
    // Patterns of up to five characters over "a", "/", "*", "?"; texts of up
    // to five characters over "a", "A", "/"; both recursive modes; both twins.
    const wchar_t patternAlphabet[] = L"a/*?";
    const wchar_t textAlphabet[] = L"aA/";
    size_t compared = 0, disagreements = 0, matches = 0;
    for (int patternLength = 0; patternLength <= 5; ++patternLength) {
        long patternCount = 1;
        for (int i = 0; i < patternLength; ++i) patternCount *= 4;
        for (long pi = 0; pi < patternCount; ++pi) {
            std::wstring pattern;
            for (long x = pi, i = 0; i < patternLength; ++i, x /= 4) pattern += patternAlphabet[x % 4];
            for (int textLength = 0; textLength <= 5; ++textLength) {
                long textCount = 1;
                for (int i = 0; i < textLength; ++i) textCount *= 3;
                for (long ti = 0; ti < textCount; ++ti) {
                    std::wstring text;
                    for (long x = ti, i = 0; i < textLength; ++i, x /= 3) text += textAlphabet[x % 3];
                    for (bool recursive : {false, true}) {
                        const bool exact = pathSteps(pattern.c_str(), text.c_str(), recursive, false);
                        const bool folded = pathSteps(pattern.c_str(), text.c_str(), recursive, true);
                        const bool gotExact = wildpathcmp(pattern.c_str(), text.c_str(), recursive);
                        const bool gotFolded = wildcasepathcmp(pattern.c_str(), text.c_str(), recursive);
                        compared += 2;
                        if (exact) ++matches;
                        if (gotExact != exact || gotFolded != folded) {
                            if (++disagreements <= 10)
                                ADD_FAILURE() << "pattern '" << std::string(pattern.begin(), pattern.end())
                                              << "' text '" << std::string(text.begin(), text.end())
                                              << "' recursive " << recursive << ": rules " << exact << "/"
                                              << folded << ", got " << gotExact << "/" << gotFolded;
                        }
                    }
                }
            }
        }
    }
    EXPECT_EQ(0u, disagreements);
    EXPECT_EQ(1365u * 364u * 4u, compared);
    EXPECT_GT(matches, 0u);
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
