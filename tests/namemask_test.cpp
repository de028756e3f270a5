// The byte form of the name masks: the ASCII matcher answers as the wide
// matcher on every name and mask of the table, in both case rules; the
// filter a cursor puts to stored names never turns away a row that the
// evaluator accepts, and turns away rows only where evaluating them would
// have been quiet.
#include <gtest/gtest.h>

#include <clocale>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

std::string utf8(const std::wstring& text) {
    std::string out;
    for (wchar_t wc : text) {
        uint32_t c = static_cast<uint32_t>(wc);
        if (c < 0x80) {
            out.push_back(static_cast<char>(c));
        } else if (c < 0x800) {
            out.push_back(static_cast<char>(0xC0 | (c >> 6)));
            out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
        } else if (c < 0x10000) {
            out.push_back(static_cast<char>(0xE0 | (c >> 12)));
            out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
            out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
        } else {
            out.push_back(static_cast<char>(0xF0 | (c >> 18)));
            out.push_back(static_cast<char>(0x80 | ((c >> 12) & 0x3F)));
            out.push_back(static_cast<char>(0x80 | ((c >> 6) & 0x3F)));
            out.push_back(static_cast<char>(0x80 | (c & 0x3F)));
        }
    }
    return out;
}

const std::vector<std::wstring>& names() {
    static const std::vector<std::wstring> list = {
        L"", L"a", L"A", L"a.c", L"A.C", L"main.c", L"MAIN.C", L"main.cc", L"main.c.bak", L".c", L"c",
        L"abab", L"aab", L"xab", L"abcbc", L"readme", L"README.md", L"[a]", L"a]", L"[abc].txt",
        L"file?.txt", L"star*.txt", L"Makefile", L"makefile", L"data_15.so", L"DATA_1X.SO",
        L"caf\u00e9.c", L"CAF\u00c9.C", L"\u00e9", L"\u212a.txt", L"k.txt", L"K.txt", L"\u0130i.c",
        L"\u65e5\u672c.c", L"emoji\U0001F600.c", L"tab\tname", L"x.\u0441"};
    return list;
}

const std::vector<std::wstring>& masks() {
    static const std::vector<std::wstring> list = {
        L"*", L"**", L"?", L"*.c", L"*.C", L"*.c*", L"main.c", L"MAIN.C", L"?ain.c", L"*a*", L"a*b",
        L"*ab", L"*bc", L"a?", L"??", L"*?", L"?*?", L"", L"[a]", L"[a-c]*", L"[abc].txt", L"*]",
        L"file?.txt", L"star*.txt", L"*make*", L"MAKEFILE", L"data_1?.so", L"*.SO", L"readme*",
        L"k.txt", L"K*", L"*\u00e9.c", L"caf?.c", L"\u212a.txt", L"*.\u0441", L"i*"};
    return list;
}

bool ascii(const std::wstring& text) {
    for (wchar_t c : text)
        if (c < 1 || c > 127) return false;
    return true;
}

// Fields of the files table, with the name set.
struct Row {
    Fields fields;
    Row() {
        fields.add(L"FILENAME", FIELD_TEXT);
        fields.add(L"ATTR", FIELD_INT32);
        fields.add(L"SIZE", FIELD_INT64);
        fields.add(L"PATHID", FIELD_INT32);
    }
    void set(const std::wstring& name, unsigned long long size) {
        static_cast<TextField*>(fields.name(L"FILENAME"))->value(name.c_str());
        static_cast<Int32Field*>(fields.name(L"ATTR"))->value(1);
        static_cast<Int64Field*>(fields.name(L"SIZE"))->value(size);
        static_cast<Int32Field*>(fields.name(L"PATHID"))->value(7);
    }
};

struct NameMaskTest : ::testing::Test {
    void SetUp() override { std::setlocale(LC_ALL, "C.UTF-8"); }
    void TearDown() override { std::setlocale(LC_ALL, "C"); }
};

}  // namespace

TEST_F(NameMaskTest, AsciiMatcherAnswersAsTheWideMatcherOnEveryAsciiPair)
{
    FoldedByteCase fold = FoldedByteCase::fromLocale();
    int compared = 0;
    for (const std::wstring& mask : masks()) {
        for (const std::wstring& name : names()) {
            if (!ascii(mask) || !ascii(name)) continue;
            std::string m = utf8(mask);
            std::string n = utf8(name);
            for (bool caseSensitive : {true, false}) {
                bool wide = wildvccmp(mask.c_str(), name.c_str(), caseSensitive);
                bool bytes = asciiWildvccmp(reinterpret_cast<const unsigned char*>(m.c_str()),
                                            reinterpret_cast<const unsigned char*>(n.data()), n.size(),
                                            caseSensitive, fold);
                EXPECT_EQ(wide, bytes) << "mask '" << m << "' name '" << n << "' case " << caseSensitive;
                ++compared;
            }
        }
    }
    EXPECT_GT(compared, 1000);
}

TEST_F(NameMaskTest, PlainAsciiIsBytesOneTo127)
{
    const unsigned char good[] = {'a', 0x01, 0x7F};
    const unsigned char zero[] = {'a', 0x00, 'b'};
    const unsigned char high[] = {'a', 0xC3, 0xA9};
    EXPECT_TRUE(isPlainAscii(good, 3));
    EXPECT_FALSE(isPlainAscii(zero, 3));
    EXPECT_FALSE(isPlainAscii(high, 3));
    EXPECT_TRUE(isPlainAscii(high, 0));
}

TEST_F(NameMaskTest, FilterNeverTurnsAwayARowTheEvaluatorAccepts)
{
    const std::vector<std::wstring> templates = {
        L"[FILENAME]==\"%\"",
        L"[FILENAME]==\"%\" || [FILENAME]==\"*.md\"",
        L"[SIZE]>1000 && [FILENAME]==\"%\"",
        L"([FILENAME]==\"%\") && ([SIZE]>=0)",
        L"[FILENAME]==\"%\" && [SIZE]/[ATTR]==5",
        L"[SIZE]/[ATTR]==5 && [FILENAME]==\"%\"",
        L"!([FILENAME]==\"%\")",
        L"[FILENAME]!=\"%\"",
        L"\"%\"==[FILENAME]",
        L"[FILENAME]==\"%\" || [SIZE]==3",
    };
    int turnedAway = 0;
    for (const std::wstring& mask : masks()) {
        if (mask.find(L'"') != std::wstring::npos) continue;
        for (const std::wstring& shape : templates) {
            std::wstring text = shape;
            text.replace(text.find(L'%'), 1, mask);
            for (bool caseSensitive : {true, false}) {
                Row row;
                row.set(L"first", 5);
                CriteriaEvaluator evaluator(text.c_str());
                ASSERT_TRUE(evaluator.setFields(&row.fields));
                evaluator.getHashInfo();  // parses, as a cursor's setCriteria does
                NameMaskFilter const* filter = evaluator.getNameFilter(&row.fields);
                for (const std::wstring& name : names()) {
                    for (unsigned long long size : {5ull, 5000ull}) {
                        row.set(name, size);
                        int verdict = evaluator.check(&row.fields, nullptr, caseSensitive);
                        if (filter == nullptr) continue;
                        std::string bytes = utf8(name);
                        bool may = filter->mayMatch(reinterpret_cast<const unsigned char*>(bytes.data()),
                                                    bytes.size(), caseSensitive);
                        if (verdict > 0) {
                            EXPECT_TRUE(may) << "'" << std::string(text.begin(), text.end()) << "' on '"
                                             << bytes << "'";
                        }
                        if (!may) ++turnedAway;
                    }
                }
            }
        }
    }
    EXPECT_GT(turnedAway, 500);
}

// A cursor takes the byte test's answer as the verdict where decidesAscii()
// says so, and evaluates no further: on every plain ASCII name the two must
// agree both ways, and any expression beside the mask must be evaluated.
TEST_F(NameMaskTest, ALoneMaskComparisonIsDecidedByTheByteTestAlone)
{
    int decided = 0, accepted = 0;
    for (const std::wstring& mask : masks()) {
        if (mask.find(L'"') != std::wstring::npos) continue;
        std::wstring text = L"[FILENAME]==\"" + mask + L"\"";
        for (bool caseSensitive : {true, false}) {
            Row row;
            row.set(L"first", 5);
            CriteriaEvaluator evaluator(text.c_str());
            ASSERT_TRUE(evaluator.setFields(&row.fields));
            evaluator.getHashInfo();
            NameMaskFilter const* filter = evaluator.getNameFilter(&row.fields);
            if (!ascii(mask)) {
                EXPECT_TRUE(filter == nullptr || !filter->decidesAscii());
                continue;
            }
            ASSERT_NE(nullptr, filter) << std::string(text.begin(), text.end());
            ASSERT_TRUE(filter->decidesAscii()) << std::string(text.begin(), text.end());
            for (const std::wstring& name : names()) {
                if (!ascii(name)) continue;
                row.set(name, 5);
                bool verdict = evaluator.check(&row.fields, nullptr, caseSensitive) > 0;
                std::string bytes = utf8(name);
                bool may = filter->mayMatchAscii(reinterpret_cast<const unsigned char*>(bytes.data()),
                                                 bytes.size(), caseSensitive);
                EXPECT_EQ(verdict, may) << "'" << std::string(text.begin(), text.end()) << "' on '" << bytes
                                        << "' case " << caseSensitive;
                ++decided;
                if (verdict) ++accepted;
            }
        }
    }
    EXPECT_GT(decided, 1000);
    EXPECT_GT(accepted, 100);
    const wchar_t* const evaluated[] = {
        L"[FILENAME]==\"*.c\" || [FILENAME]==\"*.md\"", L"[SIZE]>1000 && [FILENAME]==\"*.c\"",
        L"[FILENAME]==\"*.c\" && [SIZE]>=0",           L"[FILENAME]==\"*.c\" || [SIZE]==3",
    };
    for (const wchar_t* text : evaluated) {
        Row row;
        CriteriaEvaluator evaluator(text);
        ASSERT_TRUE(evaluator.setFields(&row.fields));
        evaluator.getHashInfo();
        NameMaskFilter const* filter = evaluator.getNameFilter(&row.fields);
        ASSERT_NE(nullptr, filter);
        EXPECT_FALSE(filter->decidesAscii()) << std::wstring(text).size();
    }
}

TEST_F(NameMaskTest, FilterExistsOnlyWhereATurnedAwayRowWouldHaveBeenQuiet)
{
    Row row;
    auto filterOf = [&row](const wchar_t* text, CriteriaEvaluator& evaluator) {
        evaluator.setFields(&row.fields);
        evaluator.getHashInfo();
        return evaluator.getNameFilter(&row.fields);
    };
    const unsigned char header[] = "main.h";
    {
        CriteriaEvaluator e(L"[FILENAME]==\"*.c\"");
        NameMaskFilter const* f = filterOf(L"", e);
        ASSERT_NE(nullptr, f);
        EXPECT_EQ(0u, f->getColumn());
        EXPECT_FALSE(f->mayMatch(header, 6, true));
    }
    {
        // The division runs first and may fail, with a trace: the row must
        // be evaluated.
        CriteriaEvaluator e(L"[SIZE]/[ATTR]==5 && [FILENAME]==\"*.c\"");
        NameMaskFilter const* f = filterOf(L"", e);
        EXPECT_TRUE(f == nullptr || f->mayMatch(header, 6, true));
    }
    {
        // The name decides before the division is reached.
        CriteriaEvaluator e(L"[FILENAME]==\"*.c\" && [SIZE]/[ATTR]==5");
        NameMaskFilter const* f = filterOf(L"", e);
        ASSERT_NE(nullptr, f);
        EXPECT_FALSE(f->mayMatch(header, 6, true));
    }
    {
        CriteriaEvaluator e(L"[SIZE]>=0");
        EXPECT_EQ(nullptr, filterOf(L"", e));
    }
    {
        CriteriaEvaluator e(L"[FILENAME]==\"*.c\" &&");  // does not parse
        EXPECT_EQ(nullptr, filterOf(L"", e));
    }
    {
        // A mask beyond ASCII is left to the evaluator.
        CriteriaEvaluator e(L"[FILENAME]==\"*\u00e9.c\"");
        NameMaskFilter const* f = filterOf(L"", e);
        EXPECT_TRUE(f == nullptr || f->mayMatch(header, 6, true));
    }
    {
        // A name beyond ASCII is left to the evaluator.
        CriteriaEvaluator e(L"[FILENAME]==\"*.c\"");
        NameMaskFilter const* f = filterOf(L"", e);
        ASSERT_NE(nullptr, f);
        std::string name = utf8(L"caf\u00e9.h");
        EXPECT_TRUE(f->mayMatch(reinterpret_cast<const unsigned char*>(name.data()), name.size(), true));
    }
}

TEST_F(NameMaskTest, ColumnsAreFoundOnceByPosition)
{
    Fields f;
    f.add(L"FILENAME", FIELD_TEXT);
    f.add(L"ATTR", FIELD_INT32);
    f.add(L"SIZE", FIELD_INT64);
    f.add(L"ATTR", FIELD_INT8);  // a second column of the name: the first wins
    EXPECT_EQ(0, f.indexOf(L"FILENAME"));
    EXPECT_EQ(1, f.indexOf(L"ATTR"));
    EXPECT_EQ(2, f.indexOf(L"SIZE"));
    EXPECT_EQ(-1, f.indexOf(L"PATHID"));
    EXPECT_EQ(-1, f.indexOf(L"FILENAMEX"));
    EXPECT_EQ(-1, f.indexOf(L"F"));
    EXPECT_EQ(-1, f.indexOf(L""));
    EXPECT_EQ(-1, f.indexOf(nullptr));
    EXPECT_EQ(f.at(1), f.name(L"ATTR"));
    EXPECT_EQ(nullptr, f.name(L"attr"));
}
