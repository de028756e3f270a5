// Values, the command table, the simple comparisons and the operator
// semantics of the tree walk.
#include <gtest/gtest.h>

#include <string>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/lexer.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "support/testsupport.h"

// A FileMaskLookup keeps its mask copies and hash tables after it is
// destroyed (it lives as long as its expression); the leak checker is told
// so, and only about those two allocation sites.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:FileMaskLookup::insert\nleak:FileMaskLookup::commit_transaction\n";
}

namespace {

class ConstCommand : public UnaryCmd {
public:
    int execute(ExpValue const&, ExpValue& result) override {
        result.setNumericValue(42);
        return 0;
    }
};

class JoinCommand : public BinaryCmd {
public:
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        std::wstring text = std::wstring(first.getStringValue()) + L"/" + second.getStringValue();
        result.setString(text.c_str());
        return 0;
    }
};

class RefuseCommand : public UnaryCmd {
public:
    int execute(ExpValue const&, ExpValue&) override { return -3; }
};

class UntypedCommand : public UnaryCmd {
public:
    // Fills only the text: the analyzer does not set the type for it.
    int execute(ExpValue const&, ExpValue& result) override {
        result.setStringValue(L"t");
        return 0;
    }
};

fsToken op(unsigned char type, unsigned long long number) {
    fsToken token;
    token.setType(type);
    token.setNumericValue(number);
    return token;
}

ExpValue num(long long n) {
    ExpValue v;
    v.setNumericValue(static_cast<unsigned long long>(n));
    return v;
}

ExpValue str(const wchar_t* s) {
    ExpValue v;
    v.setString(s);
    return v;
}

class ExpValueTableTest : public ::testing::Test {
protected:
    void SetUp() override { cmdTokenTable().clear(); }
    void TearDown() override { cmdTokenTable().clear(); }
};

}  // namespace

// ---------------------------------------------------------------- ExpValue

TEST(ExpValueTest, NewValueIsEmptyNumericZero) {
    ExpValue v;
    EXPECT_EQ(EXP_NUMERIC, v.getType());
    EXPECT_EQ(0u, v.number);
    EXPECT_STREQ(L"", v.getStringValue());
    EXPECT_STREQ(L"", v.getNValueString());
    EXPECT_FALSE(v.hasName());
    EXPECT_EQ(0, v.isConstant);
    EXPECT_EQ(0, v.isField);
    EXPECT_EQ(nullptr, v.lookup);
    EXPECT_TRUE(v.isInline());
}

TEST(ExpValueTest, TextOf127StaysInlineAnd128GoesToTheHeap) {
    ExpValue v;
    std::wstring inlineText(127, L'a');
    std::wstring heapText(128, L'b');
    EXPECT_TRUE(v.setStringValue(inlineText.c_str()));
    EXPECT_TRUE(v.isInline());
    EXPECT_TRUE(v.setStringValue(heapText.c_str()));
    EXPECT_FALSE(v.isInline());
    EXPECT_EQ(heapText, v.getStringValue());
    EXPECT_EQ(128u, v.getStringLength());
    EXPECT_TRUE(v.setStringValue(L"x"));
    EXPECT_TRUE(v.isInline());
}

TEST(ExpValueTest, NullTextLeavesTheValueEmpty) {
    ExpValue v;
    v.setStringValue(L"abc");
    v.setNValueString(L"COL");
    EXPECT_TRUE(v.setStringValue(nullptr));
    EXPECT_TRUE(v.setNValueString(nullptr));
    EXPECT_STREQ(L"", v.getStringValue());
    EXPECT_FALSE(v.hasName());
}

TEST(ExpValueTest, NameUsesTheSameScheme) {
    ExpValue v;
    std::wstring longName(200, L'N');
    v.setNValueString(longName.c_str());
    EXPECT_EQ(longName, v.getNValueString());
    EXPECT_TRUE(v.hasName());
}

TEST(ExpValueTest, CopyIsDeepAndCarriesTheSetPointer) {
    FileMaskLookup lookup;
    ExpValue v;
    std::wstring heapText(500, L'h');
    v.setString(heapText.c_str());
    v.setNValueString(L"NAME");
    v.isConstant = 1;
    v.isField = 1;
    v.number = 5;
    v.lookup = &lookup;
    ExpValue copy(v);
    ExpValue assigned;
    assigned = v;
    v.setStringValue(L"gone");
    for (const ExpValue* c : {&copy, &assigned}) {
        EXPECT_EQ(heapText, c->getStringValue());
        EXPECT_STREQ(L"NAME", c->getNValueString());
        EXPECT_EQ(EXP_STRING, c->getType());
        EXPECT_EQ(1, c->isConstant);
        EXPECT_EQ(1, c->isField);
        EXPECT_EQ(5u, c->number);
        EXPECT_EQ(&lookup, c->lookup);
    }
    assigned = assigned;
    EXPECT_EQ(heapText, assigned.getStringValue());
}

TEST(ExpValueTest, ClearEmptiesEverything) {
    ExpValue v = str(L"abc");
    v.setNValueString(L"X");
    v.isField = 1;
    v.clear();
    EXPECT_EQ(EXP_NUMERIC, v.getType());
    EXPECT_STREQ(L"", v.getStringValue());
    EXPECT_FALSE(v.hasName());
    EXPECT_EQ(0, v.isField);
}

TEST(ExpValueTest, ResetExpValueGivesTheEmptyValueOfAType) {
    ExpValue v = str(L"abc");
    v.number = 9;
    EXPECT_TRUE(resetExpValue(0, v));
    EXPECT_EQ(EXP_NUMERIC, v.getType());
    EXPECT_EQ(0u, v.number);
    v = num(4);
    EXPECT_TRUE(resetExpValue(1, v));
    EXPECT_EQ(EXP_STRING, v.getType());
    EXPECT_STREQ(L"", v.getStringValue());
    v = num(4);
    EXPECT_FALSE(resetExpValue(2, v));
    EXPECT_EQ(4u, v.number);
}

// ---------------------------------------------------------------- checkSimpleExpression

TEST(CheckSimpleExpressionTest, NumericFormsCompareUnsigned) {
    EXPECT_TRUE(checkSimpleExpression(5u, 0, 5u));
    EXPECT_TRUE(checkSimpleExpression(5u, 1, 5u));
    EXPECT_TRUE(checkSimpleExpression(5u, 2, 6u));
    EXPECT_TRUE(checkSimpleExpression(7u, 3, 6u));
    EXPECT_TRUE(checkSimpleExpression(5u, 4, 6u));
    EXPECT_TRUE(checkSimpleExpression(5u, 5, 6u));
    EXPECT_FALSE(checkSimpleExpression(5u, 5, 5u));
    EXPECT_FALSE(checkSimpleExpression(5u, 6, 5u));
    EXPECT_FALSE(checkSimpleExpression(5u, 99, 6u));
    // 0-1 is the largest number here, where the language compares signed.
    EXPECT_TRUE(checkSimpleExpression(0ULL - 1, 3, 0ULL));
    EXPECT_TRUE(checkSimpleExpression(static_cast<unsigned char>(255), 3,
                                      static_cast<unsigned char>(1)));
    EXPECT_TRUE(checkSimpleExpression(static_cast<unsigned short>(65535), 1,
                                      static_cast<unsigned short>(65535)));
    EXPECT_FALSE(checkSimpleExpression(static_cast<unsigned char>(1), 4,
                                       static_cast<unsigned char>(1)));
    EXPECT_TRUE(checkSimpleExpression(static_cast<uint64_t>(2), 3, static_cast<uint64_t>(1)));
    EXPECT_TRUE(checkSimpleExpression(static_cast<size_t>(1), 2, static_cast<size_t>(1)));
}

TEST(CheckSimpleExpressionTest, TextEqualityIsAWildcardMatchWithOtherAsPattern) {
    EXPECT_TRUE(checkSimpleExpression(L"report.txt", 0, L"*.txt", true));
    EXPECT_FALSE(checkSimpleExpression(L"*.txt", 0, L"report.txt", true));
    EXPECT_FALSE(checkSimpleExpression(L"report.txt", 5, L"*.txt", true));
    EXPECT_TRUE(checkSimpleExpression(L"report.txt", 5, L"*.doc", true));
    EXPECT_FALSE(checkSimpleExpression(L"REPORT.TXT", 0, L"*.txt", true));
    EXPECT_TRUE(checkSimpleExpression(L"REPORT.TXT", 0, L"*.txt", false));
}

TEST(CheckSimpleExpressionTest, TextOrderingUsesPlainComparison) {
    EXPECT_TRUE(checkSimpleExpression(L"b", 3, L"a", true));
    EXPECT_TRUE(checkSimpleExpression(L"a", 4, L"b", true));
    EXPECT_TRUE(checkSimpleExpression(L"a", 1, L"a", true));
    EXPECT_TRUE(checkSimpleExpression(L"a", 2, L"a", true));
    EXPECT_TRUE(checkSimpleExpression(L"abc", 3, L"a*", true));
    EXPECT_TRUE(checkSimpleExpression(L"B", 4, L"a", true));
    EXPECT_FALSE(checkSimpleExpression(L"B", 4, L"a", false));
    EXPECT_FALSE(checkSimpleExpression(L"a", 6, L"a", true));
    EXPECT_FALSE(checkSimpleExpression(nullptr, 0, L"a", true));
}

// ---------------------------------------------------------------- command table

TEST_F(ExpValueTableTest, AddCmdTokenRefusesBadArguments) {
    ConstCommand unary;
    JoinCommand binary;
    std::wstring name32(32, L'n');
    std::wstring name33(33, L'n');
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(nullptr, 0, 0, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"f", 0, 0, static_cast<UnaryCmd*>(nullptr)));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"", 0, 0, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(name33.c_str(), 0, 0, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"f", 2, 0, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"f", 0, 2, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"g", 0, 0, 2, &binary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"g", 0, 0, 0, static_cast<BinaryCmd*>(nullptr)));
    EXPECT_TRUE(cmdTokenTable().empty());
    EXPECT_TRUE(SyntaxAnalyzer::addCmdToken(name32.c_str(), 0, 0, &unary));
    EXPECT_EQ(1u, cmdTokenTable().size());
}

TEST_F(ExpValueTableTest, SameNameWithOtherArgumentTypesIsAnOverload) {
    ConstCommand unary;
    JoinCommand binary;
    EXPECT_TRUE(SyntaxAnalyzer::addCmdToken(L"f", 0, 0, &unary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"f", 1, 0, &unary));
    EXPECT_TRUE(SyntaxAnalyzer::addCmdToken(L"f", 0, 1, &unary));
    EXPECT_TRUE(SyntaxAnalyzer::addCmdToken(L"f", 1, 1, 1, &binary));
    EXPECT_FALSE(SyntaxAnalyzer::addCmdToken(L"f", 0, 1, 1, &binary));
    EXPECT_TRUE(SyntaxAnalyzer::addCmdToken(L"f", 1, 1, 0, &binary));
    ASSERT_EQ(4u, cmdTokenTable().size());
    CmdToken const& entry = cmdTokenTable()[2];
    EXPECT_STREQ(L"f", entry.name);
    EXPECT_EQ(2, entry.argumentCount);
    EXPECT_EQ(1, entry.returnType);
    EXPECT_EQ((std::vector<char>{1, 1}), entry.argumentTypes);
    EXPECT_EQ(&binary, entry.command.binary);
}

TEST_F(ExpValueTableTest, FindCmdTokenMatchesNameAndFirstTypes) {
    ConstCommand unary;
    JoinCommand binary;
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"path", 1, 0, 1, &binary));
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"one", 0, 1, &unary));
    EXPECT_TRUE(SyntaxAnalyzer::findCmdToken(L"path", 0, 1));
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(L"path", 1, 1));
    EXPECT_TRUE(SyntaxAnalyzer::findCmdToken(L"path", 0));
    EXPECT_TRUE(SyntaxAnalyzer::findCmdToken(L"one", 1));
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(L"one", 0));
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(L"one", 1, 0));
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(L"Path", 0, 1));
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(nullptr, 0));
}

TEST_F(ExpValueTableTest, NewAnalyzerEmptiesTheTable) {
    ConstCommand unary;
    ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"c", 0, 0, &unary));
    SyntaxAnalyzer analyzer;
    EXPECT_TRUE(cmdTokenTable().empty());
}

// ---------------------------------------------------------------- l_value

TEST_F(ExpValueTableTest, LValueOfLiterals) {
    SyntaxAnalyzer analyzer;
    ExpValue v;
    fsToken number = op(TOKEN_NUMBER, 12);
    ASSERT_TRUE(analyzer.l_value(number, v));
    EXPECT_EQ(EXP_NUMERIC, v.getType());
    EXPECT_EQ(12u, v.number);
    FileMaskLookup lookup;
    fsToken text = op(TOKEN_STRING, 0);
    text.setStringValue(L"abc");
    text.lookup = &lookup;
    ASSERT_TRUE(analyzer.l_value(text, v));
    EXPECT_EQ(EXP_STRING, v.getType());
    EXPECT_STREQ(L"abc", v.getStringValue());
    EXPECT_EQ(&lookup, v.lookup);
    // Any other token leaves the value alone.
    fsToken other = op(TOKEN_ARITHMETIC, 0);
    ASSERT_TRUE(analyzer.l_value(other, v));
    EXPECT_STREQ(L"abc", v.getStringValue());
}

TEST_F(ExpValueTableTest, LValueOfFieldsByColumnKind) {
    Fields fields;
    fields.add(L"I8", FIELD_INT8);
    fields.add(L"I16", FIELD_INT16);
    fields.add(L"I32", FIELD_INT32);
    fields.add(L"I64", FIELD_INT64);
    fields.add(L"T", FIELD_TEXT);
    fields.add(L"NT", FIELD_TEXT);
    static_cast<Int8Field*>(fields.name(L"I8"))->value(250);
    static_cast<Int16Field*>(fields.name(L"I16"))->value(65000);
    static_cast<Int32Field*>(fields.name(L"I32"))->value(4000000000u);
    static_cast<Int64Field*>(fields.name(L"I64"))->value(0x8000000000000000ULL);
    static_cast<TextField*>(fields.name(L"T"))->value(L"text");
    SyntaxAnalyzer analyzer;
    ExpValue result;
    // A parse stores the sources the walk reads.
    ASSERT_FALSE(analyzer.parse(L"1", &fields, nullptr, result, true));
    struct Case {
        const wchar_t* name;
        unsigned long long number;
    } cases[] = {{L"I8", 250}, {L"I16", 65000}, {L"I32", 4000000000u},
                 {L"I64", 0x8000000000000000ULL}};
    for (const Case& c : cases) {
        fsToken token = op(TOKEN_FIELD, 0);
        token.setStringValue(c.name);
        ExpValue v;
        ASSERT_TRUE(analyzer.l_value(token, v));
        EXPECT_EQ(EXP_NUMERIC, v.getType());
        EXPECT_EQ(c.number, v.number);
        EXPECT_STREQ(c.name, v.getNValueString());
        EXPECT_EQ(1, v.isField);
        EXPECT_EQ(0, v.isConstant);
    }
    fsToken token = op(TOKEN_FIELD, 0);
    token.setStringValue(L"T");
    ExpValue v;
    ASSERT_TRUE(analyzer.l_value(token, v));
    EXPECT_EQ(EXP_STRING, v.getType());
    EXPECT_STREQ(L"text", v.getStringValue());
    token.setStringValue(L"NT");
    ASSERT_TRUE(analyzer.l_value(token, v));
    EXPECT_STREQ(L"", v.getStringValue());
}

TEST_F(ExpValueTableTest, LValueOfAMissingFieldFails) {
    SyntaxAnalyzer analyzer;
    fsToken token = op(TOKEN_VARIABLE, 0);
    token.setStringValue(L"v");
    ExpValue v;
    testsupport::TraceCapture capture;
    EXPECT_FALSE(analyzer.l_value(token, v));
    EXPECT_TRUE(analyzer.getError());
    EXPECT_TRUE(capture.contains("SyntaxTree::l_value - variable specified not found!\n"));
}

// ---------------------------------------------------------------- resolve

TEST_F(ExpValueTableTest, ResolveBooleans) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    fsToken notOp = op(TOKEN_BOOLEAN, 2);
    ExpValue zero = num(0), three = num(3), none;
    ASSERT_TRUE(analyzer.resolve(notOp, zero, none, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(notOp, three, none, result));
    EXPECT_EQ(0u, result.number);
    fsToken andOp = op(TOKEN_BOOLEAN, 0);
    fsToken orOp = op(TOKEN_BOOLEAN, 1);
    ASSERT_TRUE(analyzer.resolve(andOp, three, three, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(orOp, zero, three, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(orOp, zero, zero, result));
    EXPECT_EQ(0u, result.number);
    ExpValue text = str(L"a");
    EXPECT_FALSE(analyzer.resolve(notOp, text, none, result));
    EXPECT_TRUE(analyzer.getError());
}

TEST_F(ExpValueTableTest, ResolveAndOrRefuseText) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    fsToken andOp = op(TOKEN_BOOLEAN, 0);
    ExpValue text = str(L"a"), one = num(1);
    EXPECT_FALSE(analyzer.resolve(andOp, one, text, result));
}

TEST_F(ExpValueTableTest, ResolveArithmetic) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue seven = num(7), two = num(2), minusSeven = num(-7), none;
    struct Case {
        unsigned int op;
        ExpValue* left;
        ExpValue* right;
        long long expected;
    } cases[] = {{0, &seven, &two, 9},  {2, &two, &seven, -5},    {4, &seven, &two, 14},
                 {5, &seven, &two, 3},  {5, &minusSeven, &two, -3}, {6, &seven, &two, 2},
                 {7, &seven, &two, 7},  {1, &seven, &none, 7},     {3, &seven, &none, -7}};
    for (const Case& c : cases) {
        fsToken token = op(TOKEN_ARITHMETIC, c.op);
        ASSERT_TRUE(analyzer.resolve(token, *c.left, *c.right, result)) << c.op;
        EXPECT_EQ(c.expected, static_cast<long long>(result.number)) << c.op;
        EXPECT_EQ(EXP_NUMERIC, result.getType());
    }
}

TEST_F(ExpValueTableTest, ResolveUnaryOnTextFails) {
    SyntaxAnalyzer analyzer;
    ExpValue result, none;
    ExpValue text = str(L"a");
    fsToken minus = op(TOKEN_ARITHMETIC, 3);
    EXPECT_FALSE(analyzer.resolve(minus, text, none, result));
}

TEST_F(ExpValueTableTest, ResolveDivisionByZeroFailsWithATrace) {
    SyntaxAnalyzer analyzer;
    ExpValue result = num(11);
    ExpValue seven = num(7), zero = num(0);
    fsToken divide = op(TOKEN_ARITHMETIC, 5);
    testsupport::TraceCapture capture;
    EXPECT_FALSE(analyzer.resolve(divide, seven, zero, result));
    EXPECT_TRUE(analyzer.getError());
    EXPECT_EQ(11u, result.number);
    EXPECT_TRUE(capture.contains("SyntaxTree::resolve - division by zero\n"));
}

TEST_F(ExpValueTableTest, ResolveTextOperators) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue a = str(L"ab"), b = str(L"cd");
    fsToken plus = op(TOKEN_ARITHMETIC, 0);
    ASSERT_TRUE(analyzer.resolve(plus, a, b, result));
    EXPECT_EQ(EXP_STRING, result.getType());
    EXPECT_STREQ(L"abcd", result.getStringValue());
    // Other operators on texts leave the result alone, without failure.
    ExpValue untouched = num(5);
    fsToken minus = op(TOKEN_ARITHMETIC, 2);
    ASSERT_TRUE(analyzer.resolve(minus, a, b, untouched));
    EXPECT_EQ(5u, untouched.number);
    // So does a mix of types.
    ExpValue one = num(1);
    ASSERT_TRUE(analyzer.resolve(plus, a, one, untouched));
    EXPECT_EQ(5u, untouched.number);
    EXPECT_FALSE(analyzer.getError());
}

TEST_F(ExpValueTableTest, ResolveConcatenationLimit) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring big(4194302, L'x');
    ExpValue left = str(big.c_str());
    ExpValue one = str(L"y");
    ExpValue empty = str(L"");
    fsToken plus = op(TOKEN_ARITHMETIC, 0);
    ASSERT_TRUE(analyzer.resolve(plus, left, empty, result));
    EXPECT_EQ(4194302u, result.getStringLength());
    testsupport::TraceCapture capture;
    EXPECT_FALSE(analyzer.resolve(plus, left, one, result));
    EXPECT_TRUE(
        capture.contains("SyntaxTree::resolve - string space not available for concatenation\n"));
}

TEST_F(ExpValueTableTest, ResolveRelations) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue minusOne = num(-1), zero = num(0);
    fsToken less = op(TOKEN_RELATIONAL, 4);
    ASSERT_TRUE(analyzer.resolve(less, minusOne, zero, result));
    EXPECT_EQ(1u, result.number);  // signed
    ExpValue name = str(L"report.txt"), pattern = str(L"*.txt");
    fsToken equal = op(TOKEN_RELATIONAL, 0);
    fsToken notEqual = op(TOKEN_RELATIONAL, 5);
    ASSERT_TRUE(analyzer.resolve(equal, name, pattern, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(equal, pattern, name, result));
    EXPECT_EQ(0u, result.number);
    ASSERT_TRUE(analyzer.resolve(notEqual, name, pattern, result));
    EXPECT_EQ(0u, result.number);
    fsToken greaterEqual = op(TOKEN_RELATIONAL, 1);
    ExpValue star = str(L"*");
    ASSERT_TRUE(analyzer.resolve(greaterEqual, name, star, result));
    EXPECT_EQ(1u, result.number);
    // A mix leaves the result alone.
    ExpValue untouched = num(8);
    ASSERT_TRUE(analyzer.resolve(equal, name, zero, untouched));
    EXPECT_EQ(8u, untouched.number);
}

TEST_F(ExpValueTableTest, ResolveThroughASet) {
    SyntaxAnalyzer analyzer;
    FileMaskLookup lookup;
    lookup.insert_stringlist(L"\"a*\",\"b\"");
    lookup.commit_transaction(true);
    ExpValue set = str(L"\"a*\",\"b\"");
    set.lookup = &lookup;
    fsToken equal = op(TOKEN_RELATIONAL, 0);
    fsToken notEqual = op(TOKEN_RELATIONAL, 5);
    ExpValue result;
    ExpValue apple = str(L"apple"), b = str(L"b"), c = str(L"c");
    ASSERT_TRUE(analyzer.resolve(equal, apple, set, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(equal, b, set, result));
    EXPECT_EQ(1u, result.number);
    ASSERT_TRUE(analyzer.resolve(equal, c, set, result));
    EXPECT_EQ(0u, result.number);
    ASSERT_TRUE(analyzer.resolve(notEqual, c, set, result));
    EXPECT_EQ(1u, result.number);
    // On the left a set is only its text.
    ASSERT_TRUE(analyzer.resolve(equal, set, apple, result));
    EXPECT_EQ(0u, result.number);
}

TEST_F(ExpValueTableTest, ResolveCommands) {
    SyntaxAnalyzer analyzer;
    ConstCommand constant;
    JoinCommand join;
    RefuseCommand refuse;
    UntypedCommand untyped;
    ASSERT_TRUE(analyzer.addCmdToken(L"k", 0, 0, &constant));
    ASSERT_TRUE(analyzer.addCmdToken(L"j", 1, 1, 1, &join));
    ASSERT_TRUE(analyzer.addCmdToken(L"r", 0, 0, &refuse));
    ASSERT_TRUE(analyzer.addCmdToken(L"u", 1, 0, &untyped));
    ExpValue result, none;
    ExpValue one = num(1), a = str(L"a"), b = str(L"b");

    fsToken k = op(TOKEN_COMMAND, 0);
    k.setStringValue(L"k");
    ASSERT_TRUE(analyzer.resolve(k, one, none, result));
    EXPECT_EQ(42u, result.number);

    fsToken j = op(TOKEN_COMMAND, 1);
    j.setStringValue(L"j");
    ASSERT_TRUE(analyzer.resolve(j, a, b, result));
    EXPECT_STREQ(L"a/b", result.getStringValue());

    fsToken u = op(TOKEN_COMMAND, 3);
    u.setStringValue(L"u");
    ASSERT_TRUE(analyzer.resolve(u, one, none, result));
    EXPECT_STREQ(L"t", result.getStringValue());
    EXPECT_EQ(EXP_NUMERIC, result.getType());  // the command set no type

    {
        testsupport::TraceCapture capture;
        EXPECT_FALSE(analyzer.resolve(k, a, none, result));
        EXPECT_TRUE(capture.contains("SyntaxTree::resolve - command[k], arguments type mismatch\n"));
    }
    {
        testsupport::TraceCapture capture;
        EXPECT_FALSE(analyzer.resolve(j, a, one, result));
        EXPECT_TRUE(capture.contains("SyntaxTree::resolve - command[j], arguments type mismatch\n"));
    }
    {
        fsToken r = op(TOKEN_COMMAND, 2);
        r.setStringValue(L"r");
        testsupport::TraceCapture capture;
        EXPECT_FALSE(analyzer.resolve(r, one, none, result));
        EXPECT_TRUE(capture.contains("SyntaxAnalyzer::resolve - command[r]: execute failed!\n"));
    }
    {
        fsToken gone = op(TOKEN_COMMAND, 9);
        gone.setStringValue(L"gone");
        testsupport::TraceCapture capture;
        EXPECT_FALSE(analyzer.resolve(gone, one, none, result));
        EXPECT_TRUE(capture.contains("SyntaxTree::resolve - command[gone] not supported\n"));
    }
}

TEST_F(ExpValueTableTest, EvaluateExpOfNullIsEmpty) {
    SyntaxAnalyzer analyzer;
    ExpValue v = analyzer.evaluateExp(nullptr);
    EXPECT_EQ(EXP_NUMERIC, v.getType());
    EXPECT_EQ(0u, v.number);
    EXPECT_FALSE(analyzer.getError());
}

TEST_F(ExpValueTableTest, EvaluateExpOfAHandBuiltTree) {
    SyntaxAnalyzer analyzer;
    Tree tree;
    TreeNode* root = tree.setRoot();
    tree.setData(root, op(TOKEN_ARITHMETIC, 4));
    TreeNode* left = tree.setLeftTreeNode(root, op(TOKEN_ARITHMETIC, 2));
    tree.setLeftTreeNode(left, op(TOKEN_NUMBER, 10));
    tree.setRightTreeNode(left, op(TOKEN_NUMBER, 4));
    tree.setRightTreeNode(root, op(TOKEN_NUMBER, 3));
    ExpValue v = analyzer.evaluateExp(tree.getRoot());
    EXPECT_EQ(18u, v.number);
}

TEST_F(ExpValueTableTest, GetHashValueNeedsSimpleAndAName) {
    Fields fields;
    fields.add(L"A", FIELD_INT32);
    SyntaxAnalyzer analyzer;
    ExpValue result, out;
    EXPECT_FALSE(analyzer.getHashValue(out));
    ASSERT_FALSE(analyzer.parse(L"[A]==3", &fields, nullptr, result, true));
    ASSERT_TRUE(analyzer.getHashValue(out));
    EXPECT_STREQ(L"A", out.getNValueString());
    EXPECT_EQ(3u, out.number);
    EXPECT_EQ(EXP_NUMERIC, out.getType());
    ASSERT_FALSE(analyzer.parse(L"[A]>3", &fields, nullptr, result, true));
    EXPECT_FALSE(analyzer.getHashValue(out));
}
