// A table of expressions with their value or failure, each evaluated twice:
// once by the first pass over the text and once by the walk of the tree that
// pass built.  Both must agree.
#include <gtest/gtest.h>

#include <cwctype>
#include <string>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "support/testsupport.h"

// A FileMaskLookup keeps its mask copies and hash tables after it is
// destroyed (it lives as long as its expression); the leak checker is told
// so, and only about those two allocation sites.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:FileMaskLookup::insert\nleak:FileMaskLookup::commit_transaction\n";
}

namespace {

class TwiceCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        result.setNumericValue(argument.number * 2);
        return 0;
    }
};

class UpperCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        std::wstring text(argument.getStringValue());
        for (wchar_t& c : text) {
            c = static_cast<wchar_t>(towupper(c));
        }
        result.setString(text.c_str());
        return 0;
    }
};

class CatCommand : public BinaryCmd {
public:
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        std::wstring text = std::wstring(first.getStringValue()) + second.getStringValue();
        result.setString(text.c_str());
        return 0;
    }
};

class AddCommand : public BinaryCmd {
public:
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        result.setNumericValue(first.number + second.number);
        return 0;
    }
};

class LenCommand : public BinaryCmd {
public:
    // Number from a string and a number: length of the text plus the number.
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        result.setNumericValue(first.getStringLength() + second.number);
        return 0;
    }
};

class FailCommand : public UnaryCmd {
public:
    int execute(ExpValue const&, ExpValue&) override { return 1; }
};

enum Kind { NUM, STR, FAIL };

struct Row {
    const wchar_t* expression;
    bool caseSensitive;
    Kind kind;
    long long number;
    const wchar_t* text;
    const char* message;  // for FAIL: a part of the trace line
};

Row N(const wchar_t* e, long long n, bool cs = true) {
    return Row{e, cs, NUM, n, nullptr, nullptr};
}
Row S(const wchar_t* e, const wchar_t* t, bool cs = true) {
    return Row{e, cs, STR, 0, t, nullptr};
}
Row F(const wchar_t* e, const char* m) {
    return Row{e, true, FAIL, 0, nullptr, m};
}

const std::vector<Row>& table() {
    static const std::vector<Row> rows = {
        // literals
        N(L"0", 0),
        N(L"7", 7),
        N(L"007", 7),
        // a literal beyond the signed range stops at its maximum
        N(L"18446744073709551615", 9223372036854775807LL),
        N(L"1.5", 0),
        N(L".5", 0),
        N(L".5+1", 1),
        S(L"\"abc\"", L"abc"),
        S(L"\"\"", L""),
        S(L"\"a b\"", L"a b"),
        N(L"(7)", 7),
        N(L"((((7))))", 7),
        // precedence
        N(L"1+2*3", 7),
        N(L"(1+2)*3", 9),
        N(L"2*3+4*5", 26),
        N(L"2*(3+4)*5", 70),
        N(L"1|2&3", 3),
        N(L"6&3|8", 10),
        N(L"1+2==3", 1),
        N(L"3==1+2", 1),
        N(L"1+1==2&&2*2==4", 1),
        N(L"1||0&&0", 1),
        N(L"0&&1||1", 1),
        N(L"0||0&&1", 0),
        N(L"1==2||3==3", 1),
        N(L"1<2&&2<1", 0),
        N(L"-2*3", -6),
        N(L"-(2*3)", -6),
        N(L"!0+1", 2),
        N(L"!(0+1)", 0),
        N(L"2+3&1", 3),
        N(L"1|1==1", 1),
        // left associativity
        N(L"10-4-3", 3),
        N(L"10-(4-3)", 9),
        N(L"100/10/5", 2),
        N(L"100/(10/5)", 50),
        N(L"2*3*4", 24),
        N(L"1-1-1-1", -2),
        N(L"12&10&8", 8),
        // chained relations
        N(L"1==1==1", 1),
        N(L"2==2==2", 0),
        N(L"3>2>1", 0),
        N(L"1<2<3", 1),
        N(L"3>2==1", 1),
        N(L"5!=4!=0", 1),
        N(L"1<=1>=1", 1),
        N(L"2>=3<=0", 1),
        // unary
        N(L"!0", 1),
        N(L"!5", 0),
        N(L"!!7", 1),
        N(L"!!0", 0),
        N(L"+5", 5),
        N(L"-5", -5),
        N(L"--3", 3),
        N(L"-(-3)", 3),
        N(L"+-+3", -3),
        N(L"-0", 0),
        N(L"!-1", 0),
        // signed arithmetic and comparisons
        N(L"0-1", -1),
        N(L"0-1<0", 1),
        N(L"-1<0", 1),
        N(L"-1<1", 1),
        N(L"18446744073709551615<0", 0),
        N(L"18446744073709551615==9223372036854775807", 1),
        N(L"0-9223372036854775807-2>0", 1),
        N(L"9223372036854775807+1<0", 1),
        N(L"9223372036854775807+1==0-9223372036854775807-1", 1),
        N(L"(0-9223372036854775807-1)/(0-1)==0-9223372036854775807-1", 1),
        N(L"7/2", 3),
        N(L"0-7/2", -3),
        N(L"(0-7)/2", -3),
        N(L"(0-7)/(0-2)", 3),
        N(L"7/(0-2)", -3),
        N(L"4294967296*4294967296", 0),
        N(L"3*0-1", -1),
        N(L"5&3", 1),
        N(L"5|3", 7),
        N(L"0|0", 0),
        // fields and variables
        N(L"[SIZE]", 1000),
        N(L"[SIZE]==1000", 1),
        N(L"[SIZE]>999", 1),
        N(L"[SIZE]<1000", 0),
        N(L"[SIZE]*2+1", 2001),
        N(L"-[SIZE]", -1000),
        N(L"-[SIZE]<0", 1),
        N(L"[ATTR]", 33),
        N(L"[ATTR]&1", 1),
        N(L"[ATTR]&2", 0),
        N(L"[ATTR]|2", 35),
        N(L"[B8]==200", 1),
        N(L"[W16]>59999", 1),
        N(L"[B8]+[W16]", 60200),
        N(L"[BIG]<0", 1),
        N(L"[BIG]==0-1", 1),
        N(L"[BIG]+1", 0),
        N(L"var1", 5),
        N(L"var1==5", 1),
        N(L"var1*[SIZE]", 5000),
        N(L"[SIZE]==var1*200", 1),
        S(L"vname", L"abc"),
        N(L"vname==\"a*\"", 1),
        S(L"[NAME]", L"report.txt"),
        S(L"[EMPTY]", L""),
        N(L"[EMPTY]==\"\"", 1),
        // strings
        S(L"\"a\"+\"b\"", L"ab"),
        S(L"\"a\"+\"b\"+\"c\"", L"abc"),
        S(L"[NAME]+\".bak\"", L"report.txt.bak"),
        S(L"\"x\"+[EMPTY]+\"y\"", L"xy"),
        N(L"\"a\"+\"b\"==\"ab\"", 1),
        N(L"\"x\"==\"x\"", 1),
        N(L"\"a\"!=\"a\"", 0),
        N(L"\"a\"!=\"b\"", 1),
        N(L"\"b\">\"a\"", 1),
        N(L"\"a\"<\"b\"", 1),
        N(L"\"abc\"<=\"abd\"", 1),
        N(L"\"abd\">=\"abc\"", 1),
        N(L"\"\"==\"\"", 1),
        N(L"\"\"<\"a\"", 1),
        // case flag
        N(L"\"ABC\"==\"abc\"", 0, true),
        N(L"\"ABC\"==\"abc\"", 1, false),
        N(L"\"ABC\"<\"abc\"", 1, true),
        N(L"\"ABC\"<\"abc\"", 0, false),
        N(L"[NAME]==\"REPORT.TXT\"", 0, true),
        N(L"[NAME]==\"REPORT.TXT\"", 1, false),
        N(L"[NAME]==\"REP*\"", 0, true),
        N(L"[NAME]==\"REP*\"", 1, false),
        // wildcards act on the right side of == and != only
        N(L"[NAME]==\"*.txt\"", 1),
        N(L"[NAME]==\"*.doc\"", 0),
        N(L"[NAME]!=\"*.doc\"", 1),
        N(L"[NAME]!=\"*.txt\"", 0),
        N(L"[NAME]==\"report.???\"", 1),
        N(L"[NAME]==\"r*t\"", 1),
        N(L"\"*.txt\"==[NAME]", 0),
        N(L"\"abc\"==\"a?c\"", 1),
        N(L"\"abc\"==\"a*\"", 1),
        N(L"\"a*\"==\"abc\"", 0),
        N(L"\"a*\"==\"a*\"", 1),
        N(L"\"abc\"!=\"a*\"", 0),
        N(L"\"abc\">=\"a*\"", 1),
        N(L"[NAME]>=\"*\"", 1),
        N(L"[NAME]<\"*\"", 0),
        N(L"\"report.txt\"==[PAT]", 1),
        N(L"\"other.txt\"==[PAT]", 0),
        N(L"[PAT]==\"report.txt\"", 0),
        N(L"\"report.txt\"!=[PAT]", 0),
        // sets
        N(L"[NAME]=={\"*.txt\"}", 1),
        N(L"[NAME]=={\"a*\",\"b\"}", 0),
        N(L"[NAME]=={\"a*\" \"report.txt\"}", 1),
        N(L"[NAME]!={\"*.doc\"}", 1),
        N(L"[NAME]!={\"*.txt\"}", 0),
        N(L"[NAME]=={\"rep*\"}", 1),
        N(L"[NAME]=={\"*\"}", 1),
        N(L"[NAME]=={\"REPORT.TXT\"}", 0, false),
        N(L"{\"*.txt\"}==[NAME]", 0),
        N(L"\"b\"=={\"a\",\"b\"}", 1),
        N(L"vname=={\"a*\",\"b\"}", 1),
        N(L"vname=={\"b\",\"a*\"}", 1),
        N(L"\"b\"=={\"a*\",\"b\"}", 1),
        N(L"\"c\"=={\"a*\",\"b\"}", 0),
        N(L"\"c\"!={\"a*\",\"b\"}", 1),
        // only quoted masks enter a set: unquoted text is ignored
        N(L"vname=={a*,b}", 0),
        N(L"\"b\"=={a*,b}", 0),
        N(L"vname!={abc}", 1),
        // the masks of a set: a lone star at either end may match nothing
        N(L"vname=={\"*abc\"}", 1),
        N(L"vname=={\"abc*\"}", 1),
        N(L"vname=={\"*bc\"}", 1),
        N(L"vname=={\"*b\"}", 0),
        N(L"vname=={\"a?c\"}", 1),
        N(L"vname=={\"*b*\"}", 1),
        N(L"vname=={\"a?\"}", 0),
        N(L"vname=={\"\",\"abc\"}", 1),
        N(L"vname=={\"\"}", 0),
        // a set on the left is only its text
        N(L"{\"a*\",\"b\"}==\"b\"", 0),
        N(L"[NAME]=={\"*.txt\"}&&[SIZE]>1", 1),
        N(L"[NAME]=={\"*.doc\"}||[SIZE]>1", 1),
        // commands of one and two arguments
        N(L"twice(4)", 8),
        N(L"twice(2+3)*2", 20),
        N(L"twice(twice(1))", 4),
        N(L"twice([SIZE])==2000", 1),
        N(L"1+twice(1)", 3),
        S(L"upper(\"ab\")", L"AB"),
        S(L"upper([NAME])", L"REPORT.TXT"),
        N(L"upper([NAME])==\"REPORT.TXT\"", 1),
        S(L"cat(\"a\",\"b\")", L"ab"),
        S(L"cat([NAME],\"!\")", L"report.txt!"),
        S(L"cat(cat(\"a\",\"b\"),upper(\"c\"))", L"abC"),
        N(L"add(1,2)", 3),
        N(L"add(1,2)==3", 1),
        N(L"add(1+1,2*2)", 6),
        N(L"add(1==1,2)", 3),
        N(L"len(\"abcd\",1)", 5),
        N(L"len([NAME],0)==10", 1),
        N(L"0&&fail(1)", 0),
        N(L"1||fail(1)", 1),
        // short circuits with dead failures that only the arithmetic knows
        N(L"0&&5/0", 0),
        N(L"1||5/0", 1),
        N(L"0&&1&&5/0", 0),
        N(L"(1||5/0)&&1", 1),
        // failures of the type checks
        F(L"\"a\"+1", "SyntaxAnalyzer::expression - expression operands of different types or not NUMERIC\n"),
        F(L"1+\"a\"", "SyntaxAnalyzer::expression - expression operands of different types or not NUMERIC\n"),
        F(L"\"a\"-\"b\"", "SyntaxAnalyzer::expression - operator '-' not permitted on string type\n"),
        F(L"\"a\"|\"b\"", "SyntaxAnalyzer::expression - operator '|' not permitted on string type\n"),
        F(L"\"a\"*\"b\"", "SyntaxAnalyzer::term - term operands of different types or not NUMERIC\n"),
        F(L"2/\"b\"", "SyntaxAnalyzer::term - term operands of different types or not NUMERIC\n"),
        F(L"\"a\"&1", "SyntaxAnalyzer::term - term operands of different types or not NUMERIC\n"),
        F(L"1&&\"a\"", "SyntaxAnalyzer::bTerm - bTerm operands of different types or not NUMERIC\n"),
        F(L"\"a\"&&1", "SyntaxAnalyzer::bTerm - bTerm operands of different types or not NUMERIC\n"),
        F(L"\"a\"||1", "SyntaxAnalyzer::bExpression - bExpression operands of different types or not NUMERIC\n"),
        F(L"0||\"a\"", "SyntaxAnalyzer::bExpression - bExpression operands of different types or not NUMERIC\n"),
        F(L"\"a\"==1", "SyntaxAnalyzer::relation - relation operands of different types!\n"),
        F(L"[NAME]>[SIZE]", "SyntaxAnalyzer::relation - relation operands of different types!\n"),
        F(L"-\"a\"", "SyntaxAnalyzer::factor - factor operand is not NUMERIC\n"),
        F(L"+[NAME]", "SyntaxAnalyzer::factor - factor operand is not NUMERIC\n"),
        F(L"!\"a\"", "SyntaxAnalyzer::factor - factor operand is not NUMERIC\n"),
        // failures of the syntax
        F(L"", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"1 2", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"[SIZE]==1 ", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"1\t", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"1)", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"1,2", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"1 || 1 2", "SyntaxAnalyzer::parse - expected operator.\n"),
        F(L"(1", "SyntaxAnalyzer::factor - expected ')'\n"),
        F(L"(1 2)", "SyntaxAnalyzer::factor - expected ')'\n"),
        F(L"()", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L")", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"1+", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"==1", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L".", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L";", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"1.", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"\"abc", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"[NAME]=={\"a\"", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"[A_B]==1", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L" ", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"*1", "SyntaxAnalyzer::factor - expected '+' or '-'!\n"),
        F(L"/1", "SyntaxAnalyzer::factor - expected '+' or '-'!\n"),
        F(L"|1", "SyntaxAnalyzer::factor - expected '+' or '-'!\n"),
        F(L"&&1", "SyntaxAnalyzer::factor - expected '!'\n"),
        F(L"||1", "SyntaxAnalyzer::factor - expected '!'\n"),
        // a syntax error on the dead side still fails
        F(L"0&&(1", "SyntaxAnalyzer::factor - expected ')'\n"),
        F(L"1||(2+)", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"0&&[NOPE]==1", "SyntaxAnalyzer::factor - variable specified not found!\n"),
        F(L"1||\"a\"+1", "SyntaxAnalyzer::expression - expression operands of different types or not NUMERIC\n"),
        // unknown fields and variables
        F(L"[NOPE]==1", "SyntaxAnalyzer::factor - variable specified not found!\n"),
        F(L"nope==1", "SyntaxAnalyzer::factor - variable specified not found!\n"),
        F(L"[var1]==5", "SyntaxAnalyzer::factor - variable specified not found!\n"),
        F(L"[HEX]==1", "SyntaxTree::l_value - field type 6 not supported\n"),
        // names of fields, variables and commands compare exactly, whatever the case flag
        Row{L"[name]==\"report.txt\"", false, FAIL, 0, nullptr,
            "SyntaxAnalyzer::factor - variable specified not found!\n"},
        Row{L"VAR1==5", false, FAIL, 0, nullptr, "SyntaxAnalyzer::factor - variable specified not found!\n"},
        Row{L"TWICE(1)==2", false, FAIL, 0, nullptr, "SyntaxAnalyzer::factor - variable specified not found!\n"},
        // commands used wrongly
        F(L"twice(\"a\")", "SyntaxAnalyzer::factor - command[twice]: parameter type mismatch!\n"),
        F(L"add(\"a\",1)", "SyntaxAnalyzer::factor - command[add]: first parameter type mismatch!\n"),
        F(L"add(1,\"a\")", "SyntaxAnalyzer::factor - command[add]: second parameter type mismatch!\n"),
        F(L"twice 4", "SyntaxAnalyzer::factor - command[twice]: '(' expected!\n"),
        F(L"twice", "SyntaxAnalyzer::factor - command[twice]: '(' expected!\n"),
        F(L"add(1 2)", "SyntaxAnalyzer::factor - command[add]: ',' expected!\n"),
        F(L"add(1;2)", "SyntaxAnalyzer::factor - command[add]: ',' expected!\n"),
        F(L"add(1)", "SyntaxAnalyzer::factor - command[add]: ',' expected!\n"),
        F(L"add(1,2", "SyntaxAnalyzer::factor - command[add]: ')' expected!\n"),
        F(L"twice(1,2)", "SyntaxAnalyzer::factor - command[twice]: ')' expected!\n"),
        F(L"fail(1)", "SyntaxAnalyzer::factor - command[fail]: execute failed!\n"),
        F(L"twice()", "SyntaxAnalyzer::factor - unexpected sequence!\n"),
        F(L"twice(1)+\"a\"", "SyntaxAnalyzer::expression - expression operands of different types or not NUMERIC\n"),
        // the one arithmetic fault
        F(L"5/0", "SyntaxAnalyzer::term - division by zero!\n"),
        F(L"1&&5/0", "SyntaxAnalyzer::term - division by zero!\n"),
        F(L"[SIZE]/([SIZE]-1000)", "SyntaxAnalyzer::term - division by zero!\n"),
    };
    return rows;
}

class ExpressionTableTest : public ::testing::Test {
protected:
    ExpressionTableTest() {
        fields.add(L"NAME", FIELD_TEXT);
        fields.add(L"SIZE", FIELD_INT64);
        fields.add(L"ATTR", FIELD_INT32);
        fields.add(L"B8", FIELD_INT8);
        fields.add(L"W16", FIELD_INT16);
        fields.add(L"EMPTY", FIELD_TEXT);
        fields.add(L"BIG", FIELD_INT64);
        fields.add(L"HEX", FIELD_HEX);
        fields.add(L"PAT", FIELD_TEXT);
        static_cast<TextField*>(fields.name(L"PAT"))->value(L"rep*");
        static_cast<TextField*>(fields.name(L"NAME"))->value(L"report.txt");
        static_cast<Int64Field*>(fields.name(L"SIZE"))->value(1000);
        static_cast<Int32Field*>(fields.name(L"ATTR"))->value(0x21);
        static_cast<Int8Field*>(fields.name(L"B8"))->value(200);
        static_cast<Int16Field*>(fields.name(L"W16"))->value(60000);
        static_cast<Int64Field*>(fields.name(L"BIG"))->value(0xFFFFFFFFFFFFFFFFULL);
        variables.add(L"var1", FIELD_INT32);
        variables.add(L"vname", FIELD_TEXT);
        static_cast<Int32Field*>(variables.name(L"var1"))->value(5);
        static_cast<TextField*>(variables.name(L"vname"))->value(L"abc");
    }

    // A fresh analyzer with the test's commands.
    void registerCommands() {
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"twice", 0, 0, &twice));
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"upper", 1, 1, &upper));
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"cat", 1, 1, 1, &cat));
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"add", 0, 0, 0, &add));
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"len", 0, 1, 0, &len));
        ASSERT_TRUE(SyntaxAnalyzer::addCmdToken(L"fail", 0, 0, &failing));
    }

    Fields fields;
    Fields variables;
    TwiceCommand twice;
    UpperCommand upper;
    CatCommand cat;
    AddCommand add;
    LenCommand len;
    FailCommand failing;
};

std::string narrow(const wchar_t* text) {
    std::string out;
    for (const wchar_t* p = text; *p != L'\0'; ++p) {
        out += (*p < 128) ? static_cast<char>(*p) : '?';
    }
    return out;
}

void expectValue(const Row& row, const ExpValue& value, const char* how) {
    std::string label = narrow(row.expression) + " (" + how + ")";
    if (row.kind == NUM) {
        EXPECT_EQ(EXP_NUMERIC, value.getType()) << label;
        EXPECT_EQ(row.number, static_cast<long long>(value.number)) << label;
    } else {
        EXPECT_EQ(EXP_STRING, value.getType()) << label;
        EXPECT_STREQ(row.text, value.getStringValue()) << label;
    }
}

}  // namespace

TEST_F(ExpressionTableTest, TableHasAtLeast150Rows) {
    EXPECT_GE(table().size(), 150u);
}

TEST_F(ExpressionTableTest, DirectPassAndTreeWalkGiveTheSameAnswer) {
    for (const Row& row : table()) {
        SyntaxAnalyzer analyzer;
        registerCommands();
        std::string label = narrow(row.expression);
        ExpValue direct;
        bool failed;
        {
            testsupport::TraceCapture capture;
            failed = analyzer.parse(row.expression, &fields, &variables, direct, row.caseSensitive);
            if (row.kind == FAIL) {
                EXPECT_TRUE(failed) << label;
                EXPECT_TRUE(capture.contains(row.message)) << label << "\n" << capture.dump();
                continue;
            }
            EXPECT_FALSE(failed) << label << "\n" << capture.dump();
        }
        if (failed) {
            continue;
        }
        expectValue(row, direct, "direct");

        ExpValue walked;
        walked.setNumericValue(12345);
        EXPECT_FALSE(analyzer.parse(&fields, &variables, walked, row.caseSensitive)) << label;
        expectValue(row, walked, "tree");
        // A second walk gives the same again (sets are cached in the tree).
        ExpValue again;
        EXPECT_FALSE(analyzer.parse(&fields, &variables, again, row.caseSensitive)) << label;
        expectValue(row, again, "tree again");
    }
}
