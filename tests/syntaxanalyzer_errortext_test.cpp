// Why an expression failed, read from the analyzer as a value: the text of the
// failure of its last pass, without the trace's function head.
#include <gtest/gtest.h>

#include <string>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "support/testsupport.h"

namespace {

class ErrorTextTest : public ::testing::Test {
protected:
    ErrorTextTest() {
        fields.add(L"SIZE", FIELD_INT64);
        fields.add(L"FILENAME", FIELD_TEXT);
        static_cast<TextField*>(fields.name(L"FILENAME"))->value(L"a.c");
    }
    std::string failureOf(const wchar_t* text) {
        ExpValue result;
        EXPECT_TRUE(analyzer.parse(text, &fields, nullptr, result, true)) << "expected a failure";
        return analyzer.getErrorText();
    }
    Fields fields;
    SyntaxAnalyzer analyzer;
};

}  // namespace

TEST_F(ErrorTextTest, EachFailureGivesItsOwnText) {
    EXPECT_EQ("unexpected sequence!", failureOf(L"[SIZE]>"));
    EXPECT_EQ("expected operator.", failureOf(L"1 2"));
    EXPECT_EQ("expected ')'", failureOf(L"(1"));
    EXPECT_EQ("variable specified not found!", failureOf(L"[NOPE]==1"));
    EXPECT_EQ("expression operands of different types or not NUMERIC", failureOf(L"\"a\" - 1"));
}

TEST_F(ErrorTextTest, TextIsEmptyAfterASuccessfulPassAndBeforeAnyPass) {
    EXPECT_EQ("", analyzer.getErrorText());
    EXPECT_EQ("unexpected sequence!", failureOf(L""));
    ExpValue result;
    EXPECT_FALSE(analyzer.parse(L"[SIZE]>=0", &fields, nullptr, result, true));
    EXPECT_EQ("", analyzer.getErrorText());
}

TEST_F(ErrorTextTest, FailureOfATreeWalkHasItsTextToo) {
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"[SIZE]>=0", &fields, nullptr, result, true));
    // The stored tree walked without the fields it names.
    EXPECT_TRUE(analyzer.parse(nullptr, nullptr, result, true));
    EXPECT_EQ("variable specified not found!", analyzer.getErrorText());
    SyntaxAnalyzer fresh;
    EXPECT_TRUE(fresh.parse(&fields, nullptr, result, true));
    EXPECT_EQ("no parsed expression to evaluate", fresh.getErrorText());
}

TEST_F(ErrorTextTest, TracesAreWrittenAsBefore) {
    testsupport::TraceCapture capture;
    failureOf(L"1 2");
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::parse - expected operator.\n")) << capture.dump();
}

TEST(ErrorTextOfAnEvaluator, IsReachedThroughItsAnalyzer) {
    CriteriaEvaluator evaluator(L"[SIZE]>");
    Fields columns;
    columns.add(L"SIZE", FIELD_INT64);
    evaluator.setFields(&columns);
    evaluator.getHashInfo();  // the first pass over the text
    ASSERT_NE(nullptr, evaluator.getAnalyzer());
    EXPECT_FALSE(evaluator.isValid() && !evaluator.hasFailed());
    EXPECT_EQ("unexpected sequence!", evaluator.getAnalyzer()->getErrorText());
}
