// Tokens and the lexer of the query language.
#include <gtest/gtest.h>

#include <string>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/lexer.h"
#include "fscanner/fscommon/syntaxanalyzer.h"

// A FileMaskLookup keeps its mask copies and hash tables after it is
// destroyed (it lives as long as its expression); the leak checker is told
// so, and only about those two allocation sites.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:FileMaskLookup::insert\nleak:FileMaskLookup::commit_transaction\n";
}

namespace {

class EchoCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        result = argument;
        return 0;
    }
};

// Lexes text completely; each entry is "type:number:text".
std::vector<std::string> lexAll(Lexer& lexer, wchar_t const* text) {
    lexer.setExpression(text);
    std::vector<std::string> out;
    for (int guard = 0; guard < 100; ++guard) {
        fsToken token = lexer.nextToken();
        if (lexer.getLastError() != Lexer::LEX_OK) {
            out.push_back("err" + std::to_string(lexer.getLastError()));
            break;
        }
        std::wstring wide(token.getStringValue());
        out.push_back(std::to_string(token.type) + ":" + std::to_string(token.numericValue) + ":" +
                      std::string(wide.begin(), wide.end()));
    }
    return out;
}

class LexerTest : public ::testing::Test {
protected:
    void SetUp() override { cmdTokenTable().clear(); }
    void TearDown() override { cmdTokenTable().clear(); }
    Lexer lexer;
};

}  // namespace

TEST_F(LexerTest, WithoutExpressionNextTokenIsEndWithErrorTwo) {
    fsToken token = lexer.nextToken();
    EXPECT_EQ(255, token.type);
    EXPECT_EQ(2, lexer.getLastError());
    EXPECT_FALSE(lexer.restart());
}

TEST_F(LexerTest, NullExpressionSetsErrorTwo) {
    lexer.setExpression(L"1");
    lexer.setExpression(nullptr);
    EXPECT_EQ(2, lexer.getLastError());
    EXPECT_FALSE(lexer.restart());
    EXPECT_EQ(255, lexer.nextToken().type);
    EXPECT_EQ(2, lexer.getLastError());
}

TEST_F(LexerTest, SetExpressionClearsErrorAndEndGivesErrorOne) {
    lexer.setExpression(L"42");
    EXPECT_EQ(0, lexer.getLastError());
    fsToken token = lexer.nextToken();
    EXPECT_EQ(0, token.type);
    EXPECT_EQ(42u, token.numericValue);
    EXPECT_STREQ(L"", token.getStringValue());
    EXPECT_EQ(0, lexer.getLastError());
    token = lexer.nextToken();
    EXPECT_EQ(255, token.type);
    EXPECT_EQ(0u, token.numericValue);
    EXPECT_EQ(1, lexer.getLastError());
}

TEST_F(LexerTest, EmptyExpressionIsAtEnd) {
    EXPECT_EQ((std::vector<std::string>{"err1"}), lexAll(lexer, L""));
}

TEST_F(LexerTest, TrailingBlanksGiveErrorTwoNotOne) {
    EXPECT_EQ((std::vector<std::string>{"0:1:", "err2"}), lexAll(lexer, L"1 "));
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"   "));
}

TEST_F(LexerTest, LeadingAndInnerBlanksAreSkipped) {
    EXPECT_EQ((std::vector<std::string>{"0:1:", "4:0:", "0:2:", "err1"}),
              lexAll(lexer, L"  1   +  2"));
}

TEST_F(LexerTest, TabAndLineEndAreUnrecognised) {
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"\t1"));
    EXPECT_EQ((std::vector<std::string>{"0:1:", "err2"}), lexAll(lexer, L"1\n"));
}

TEST_F(LexerTest, OperatorNumbers) {
    EXPECT_EQ((std::vector<std::string>{"7:0:", "7:1:", "7:2:", "7:3:", "7:4:", "7:5:", "err1"}),
              lexAll(lexer, L"== >= <= > < !="));
    EXPECT_EQ((std::vector<std::string>{"6:0:", "6:1:", "6:2:", "err1"}),
              lexAll(lexer, L"&& || !"));
    EXPECT_EQ((std::vector<std::string>{"4:0:", "4:2:", "4:4:", "4:5:", "4:6:", "4:7:", "err1"}),
              lexAll(lexer, L"+ - * / & |"));
    EXPECT_EQ((std::vector<std::string>{"5:0:", "5:1:", "err1"}), lexAll(lexer, L"()"));
    EXPECT_EQ((std::vector<std::string>{"9:0:", "9:1:", "9:2:", "err1"}), lexAll(lexer, L". , ;"));
}

TEST_F(LexerTest, NotEqualNeverSplitsAndDoubleAmpersandIsBoolean) {
    EXPECT_EQ((std::vector<std::string>{"7:5:", "6:2:", "err1"}), lexAll(lexer, L"!=!"));
    EXPECT_EQ((std::vector<std::string>{"6:0:", "4:6:", "err1"}), lexAll(lexer, L"&&&"));
    EXPECT_EQ((std::vector<std::string>{"6:1:", "4:7:", "err1"}), lexAll(lexer, L"|||"));
    EXPECT_EQ((std::vector<std::string>{"7:0:", "7:3:", "err1"}), lexAll(lexer, L"==>"));
    // "=" alone is nothing.
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"="));
}

TEST_F(LexerTest, NumberWithDotAndDigitsIsZero) {
    EXPECT_EQ((std::vector<std::string>{"0:0:", "err1"}), lexAll(lexer, L"1.5"));
    EXPECT_EQ((std::vector<std::string>{"0:0:", "err1"}), lexAll(lexer, L".5"));
    EXPECT_EQ((std::vector<std::string>{"0:0:", "0:0:", "err1"}), lexAll(lexer, L"1.2.3"));
}

TEST_F(LexerTest, DotAloneIsASign) {
    EXPECT_EQ((std::vector<std::string>{"9:0:", "err1"}), lexAll(lexer, L"."));
}

TEST_F(LexerTest, OneDotIsNoNumberAndTheOneIsNotDelivered) {
    lexer.setExpression(L"1.");
    fsToken token = lexer.nextToken();
    EXPECT_EQ(255, token.type);
    EXPECT_EQ(2, lexer.getLastError());
    // Back to the literal: the same failure again.
    lexer.back();
    lexer.nextToken();
    EXPECT_EQ(2, lexer.getLastError());
}

TEST_F(LexerTest, NumbersAreDecimalOnly) {
    EXPECT_EQ((std::vector<std::string>{"0:0:", "3:0:x1F", "err1"}), lexAll(lexer, L"0x1F"));
    EXPECT_EQ((std::vector<std::string>{"0:1:", "3:0:e5", "err1"}), lexAll(lexer, L"1e5"));
    // The conversion is a signed one: beyond its range it stops at the maximum.
    EXPECT_EQ((std::vector<std::string>{"0:9223372036854775807:", "err1"}),
              lexAll(lexer, L"18446744073709551615"));
    EXPECT_EQ((std::vector<std::string>{"0:9223372036854775807:", "err1"}),
              lexAll(lexer, L"9223372036854775807"));
    EXPECT_EQ((std::vector<std::string>{"0:7:", "err1"}), lexAll(lexer, L"007"));
}

TEST_F(LexerTest, VariableFieldAndString) {
    EXPECT_EQ((std::vector<std::string>{"3:0:abc1", "2:0:NAME2", "1:0:a b", "err1"}),
              lexAll(lexer, L"abc1 [NAME2] \"a b\""));
    EXPECT_EQ((std::vector<std::string>{"1:0:", "err1"}), lexAll(lexer, L"\"\""));
}

TEST_F(LexerTest, UnderscoreIsNeitherLetterNorDigit) {
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"[A_B]"));
    EXPECT_EQ((std::vector<std::string>{"3:0:A", "err2"}), lexAll(lexer, L"A_B"));
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"_a"));
}

TEST_F(LexerTest, FieldMustStartWithLetter) {
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"[1A]"));
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"[]"));
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"[A"));
}

TEST_F(LexerTest, UnterminatedStringFailsAtTheQuote) {
    EXPECT_EQ((std::vector<std::string>{"0:1:", "7:0:", "err2"}), lexAll(lexer, L"1 == \"abc"));
}

TEST_F(LexerTest, StringHasNoEscapes) {
    EXPECT_EQ((std::vector<std::string>{"1:0:a\\", "3:0:b", "err2"}),
              lexAll(lexer, L"\"a\\\"b\""));
}

TEST_F(LexerTest, UnterminatedSetFailsAtTheBrace) {
    EXPECT_EQ((std::vector<std::string>{"err2"}), lexAll(lexer, L"{\"a\""));
}

TEST_F(LexerTest, SetLiteralBuildsACommittedLookup) {
    lexer.setExpression(L"{\"*.txt\",\"readme\"}");
    fsToken token = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(1, token.type);
    EXPECT_STREQ(L"\"*.txt\",\"readme\"", token.getStringValue());
    ASSERT_NE(nullptr, token.lookup);
    EXPECT_EQ(2, token.lookup->size());
    EXPECT_TRUE(token.lookup->find(L"a.txt"));
    EXPECT_TRUE(token.lookup->find(L"readme"));
    EXPECT_FALSE(token.lookup->find(L"a.doc"));
    // Committed case-sensitively whatever the query says.
    EXPECT_FALSE(token.lookup->find(L"README"));
}

TEST_F(LexerTest, StringHasNoLookup) {
    lexer.setExpression(L"\"x\"");
    EXPECT_EQ(nullptr, lexer.nextToken().lookup);
}

TEST_F(LexerTest, CommandNameIsAPrefixMatch) {
    EchoCommand echo;
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"path", 1, 1, &echo));
    EXPECT_EQ((std::vector<std::string>{"8:0:path", "3:0:name", "err1"}),
              lexAll(lexer, L"pathname"));
    EXPECT_EQ((std::vector<std::string>{"3:0:pat", "err1"}), lexAll(lexer, L"pat"));
}

TEST_F(LexerTest, CommandTableIsWalkedInOrder) {
    EchoCommand echo;
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"ab", 1, 1, &echo));
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"abc", 1, 1, &echo));
    // "ab" comes first in the table, so "abc" can never be read.
    EXPECT_EQ((std::vector<std::string>{"8:0:ab", "3:0:c", "err1"}), lexAll(lexer, L"abc"));
}

TEST_F(LexerTest, NumberComesBeforeCommand) {
    EchoCommand echo;
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"1x", 1, 1, &echo));
    EXPECT_EQ((std::vector<std::string>{"0:1:", "3:0:x", "err1"}), lexAll(lexer, L"1x"));
}

TEST_F(LexerTest, BackIsOneStepToTheStartBeforeBlanks) {
    lexer.setExpression(L"a  b");
    EXPECT_STREQ(L"a", lexer.nextToken().getStringValue());
    EXPECT_STREQ(L"b", lexer.nextToken().getStringValue());
    lexer.back();
    lexer.back();
    EXPECT_STREQ(L"b", lexer.nextToken().getStringValue());
    EXPECT_EQ(255, lexer.nextToken().type);
    EXPECT_EQ(1, lexer.getLastError());
    lexer.back();
    EXPECT_EQ(255, lexer.nextToken().type);
    EXPECT_EQ(1, lexer.getLastError());
}

TEST_F(LexerTest, RestartGoesToTheBeginning) {
    lexer.setExpression(L"a b");
    lexer.nextToken();
    lexer.nextToken();
    EXPECT_TRUE(lexer.restart());
    EXPECT_STREQ(L"a", lexer.nextToken().getStringValue());
}

TEST_F(LexerTest, LongestStringIsAccepted) {
    std::wstring text = L"\"" + std::wstring(LEXER_MAX_LITERAL, L'x') + L"\"";
    lexer.setExpression(text.c_str());
    fsToken token = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(1, token.type);
    EXPECT_EQ(4194303u, wcslen(token.getStringValue()));
    lexer.nextToken();
    EXPECT_EQ(1, lexer.getLastError());
}

TEST_F(LexerTest, OverlongStringRepeatsThePreviousTokenOnce) {
    std::wstring text = L"1 + \"" + std::wstring(LEXER_MAX_LITERAL + 1, L'x') + L"\"";
    lexer.setExpression(text.c_str());
    EXPECT_EQ(0, lexer.nextToken().type);
    fsToken plus = lexer.nextToken();
    EXPECT_EQ(4, plus.type);
    // The refusal reports success and delivers the previous token again.
    fsToken repeated = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(4, repeated.type);
    EXPECT_EQ(0u, repeated.numericValue);
    // The position stayed at the refused literal; reading there again gives
    // nothing, so a parser can't loop on it.
    fsToken again = lexer.nextToken();
    EXPECT_EQ(255, again.type);
    EXPECT_EQ(2, lexer.getLastError());
}

TEST_F(LexerTest, OverlongSetAndFieldAreRefused) {
    std::wstring set = L"{" + std::wstring(LEXER_MAX_LITERAL + 1, L'x') + L"}";
    lexer.setExpression(set.c_str());
    fsToken token = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(255, token.type);  // nothing came before it
    EXPECT_EQ(nullptr, token.lookup);

    std::wstring field = L"[" + std::wstring(LEXER_MAX_LITERAL + 1, L'F') + L"]";
    lexer.setExpression(field.c_str());
    token = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(255, token.type);
}

TEST_F(LexerTest, VariableNameLimit) {
    std::wstring longest(LEXER_MAX_VARIABLE, L'v');
    lexer.setExpression(longest.c_str());
    fsToken token = lexer.nextToken();
    EXPECT_EQ(3, token.type);
    EXPECT_EQ(1048575u, wcslen(token.getStringValue()));

    std::wstring tooLong = L"7 " + std::wstring(LEXER_MAX_VARIABLE + 1, L'v');
    lexer.setExpression(tooLong.c_str());
    EXPECT_EQ(7u, lexer.nextToken().numericValue);
    token = lexer.nextToken();
    EXPECT_EQ(0, lexer.getLastError());
    EXPECT_EQ(0, token.type);
    EXPECT_EQ(7u, token.numericValue);
}

TEST(FsTokenTest, NewTokenIsEnd) {
    fsToken token;
    EXPECT_EQ(255, token.type);
    EXPECT_EQ(0u, token.numericValue);
    EXPECT_STREQ(L"", token.getStringValue());
    EXPECT_EQ(nullptr, token.lookup);
}

TEST(FsTokenTest, TextOf127StaysInlineAnd128GoesToTheHeap) {
    fsToken token;
    std::wstring inlineText(127, L'a');
    std::wstring heapText(128, L'b');
    EXPECT_TRUE(token.setStringValue(inlineText.c_str()));
    EXPECT_TRUE(token.isInline());
    EXPECT_EQ(inlineText, token.getStringValue());
    EXPECT_TRUE(token.setStringValue(heapText.c_str()));
    EXPECT_FALSE(token.isInline());
    EXPECT_EQ(heapText, token.getStringValue());
    EXPECT_TRUE(token.setStringValue(L"short"));
    EXPECT_TRUE(token.isInline());
    EXPECT_STREQ(L"short", token.getStringValue());
}

TEST(FsTokenTest, SetStringValueWithLengthCopiesExactly) {
    fsToken token;
    EXPECT_TRUE(token.setStringValue(L"abcdef", 3u));
    EXPECT_STREQ(L"abc", token.getStringValue());
    EXPECT_TRUE(token.setStringValue(nullptr));
    EXPECT_STREQ(L"", token.getStringValue());
}

TEST(FsTokenTest, CopyIsDeep) {
    fsToken token;
    std::wstring heapText(300, L'q');
    token.setStringValue(heapText.c_str());
    token.setType(3);
    token.setNumericValue(9);
    fsToken copy(token);
    fsToken assigned;
    assigned = token;
    copy.setStringValue(L"changed");
    EXPECT_EQ(heapText, token.getStringValue());
    EXPECT_EQ(heapText, assigned.getStringValue());
    EXPECT_NE(token.getStringValue(), assigned.getStringValue());
    EXPECT_EQ(3, assigned.type);
    EXPECT_EQ(9u, assigned.numericValue);
    assigned = assigned;
    EXPECT_EQ(heapText, assigned.getStringValue());
}

TEST_F(LexerTest, NumberValueComesFromItsFirstTwentyThreeDigits) {
    // Digits behind the 23rd are part of the token but not of its value.
    std::wstring seven = std::wstring(22, L'0') + L"7" + L"999";
    EXPECT_EQ((std::vector<std::string>{"0:7:", "err1"}), lexAll(lexer, seven.c_str()));
    std::wstring twentyThree = std::wstring(20, L'0') + L"123";
    EXPECT_EQ((std::vector<std::string>{"0:123:", "err1"}), lexAll(lexer, twentyThree.c_str()));
}

TEST_F(LexerTest, VeryLongNumberIsOneTokenAndIsReadSafely) {
    std::wstring zeros = std::wstring(5000, L'0') + L"1";
    EXPECT_EQ((std::vector<std::string>{"0:0:", "4:0:", "0:2:", "err1"}),
              lexAll(lexer, (zeros + L"+2").c_str()));
    std::wstring big = L"1" + std::wstring(5000, L'0');
    EXPECT_EQ((std::vector<std::string>{"0:9223372036854775807:", "err1"}), lexAll(lexer, big.c_str()));
    std::wstring fraction = L"." + std::wstring(5000, L'5');
    EXPECT_EQ((std::vector<std::string>{"0:0:", "err1"}), lexAll(lexer, fraction.c_str()));
}

TEST_F(LexerTest, OneDotLeavesThePositionAtTheLiteral) {
    lexer.setExpression(L"2 + 1.");
    EXPECT_EQ(0, lexer.nextToken().type);
    EXPECT_EQ(4, lexer.nextToken().type);
    EXPECT_EQ(255, lexer.nextToken().type);
    EXPECT_EQ(2, lexer.getLastError());
    // Nothing was consumed: asking again meets the same "1.", not the ".".
    fsToken again = lexer.nextToken();
    EXPECT_EQ(255, again.type);
    EXPECT_EQ(2, lexer.getLastError());
    EXPECT_EQ(0u, again.numericValue);
}

TEST_F(LexerTest, UnterminatedStringAndSetStopAtTheirOpeningMark) {
    for (const wchar_t* text : {L"1 == \"abc", L"[A] == {\"abc\""}) {
        lexer.setExpression(text);
        lexer.nextToken();
        EXPECT_EQ(7, lexer.nextToken().type);
        EXPECT_EQ(255, lexer.nextToken().type);
        EXPECT_EQ(2, lexer.getLastError());
        // The position stays at the quote or brace: what follows it is never
        // read as a token of its own.
        EXPECT_EQ(255, lexer.nextToken().type);
        EXPECT_EQ(2, lexer.getLastError());
    }
}
