// CriteriaEvaluator (checks, hash candidates) and the boolean-digit Evaluator.
#include <gtest/gtest.h>

#include <string>

#include "fscanner/fscommon/criteria.h"
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

class CountCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        ++calls;
        result.setNumericValue(argument.number);
        return 0;
    }
    int calls = 0;
};

class UpperCommand : public UnaryCmd {
public:
    int execute(ExpValue const&, ExpValue& result) override {
        result.setString(L"X");
        return 0;
    }
};

class PathCommand : public BinaryCmd {
public:
    int execute(ExpValue const&, ExpValue const&, ExpValue& result) override {
        ++calls;
        result.setString(L"/data/report.txt");
        return 0;
    }
    int calls = 0;
};

class CriteriaTest : public ::testing::Test {
protected:
    CriteriaTest() {
        fields.add(L"A", FIELD_INT32);
        fields.add(L"B", FIELD_INT32);
        fields.add(L"C", FIELD_INT32);
        fields.add(L"S", FIELD_TEXT);
        fields.add(L"PATHID", FIELD_INT32);
        variables.add(L"pathid", FIELD_INT32);
        variables.add(L"vs", FIELD_TEXT);
        setA(1);
        static_cast<TextField*>(fields.name(L"S"))->value(L"abc");
    }
    void setA(unsigned int v) { static_cast<Int32Field*>(fields.name(L"A"))->value(v); }

    Fields fields;
    Fields variables;
};

}  // namespace

TEST_F(CriteriaTest, NullExpressionIsInvalid) {
    CriteriaEvaluator evaluator(nullptr);
    EXPECT_FALSE(evaluator.isValid());
    EXPECT_EQ(nullptr, evaluator.getCriteria());
    EXPECT_EQ(-1, evaluator.check(&fields, nullptr, true));
    EXPECT_EQ(-1, evaluator.check(true));
    EXPECT_EQ(nullptr, evaluator.getHashInfo());
    EXPECT_FALSE(evaluator.setFields(&fields));
    EXPECT_FALSE(evaluator.setVariables(&variables));
    ExpValue value;
    EXPECT_FALSE(evaluator.setHashInfo(value));
    CountCommand count;
    EXPECT_FALSE(evaluator.addCmd(L"count", 0, 0, &count));
    EXPECT_FALSE(evaluator.findCmd(L"count", 0));
    EXPECT_EQ(nullptr, evaluator.getAnalyzer());
}

TEST_F(CriteriaTest, SettersRefuseNull) {
    CriteriaEvaluator evaluator(L"[A]==1");
    EXPECT_TRUE(evaluator.isValid());
    EXPECT_STREQ(L"[A]==1", evaluator.getCriteria());
    EXPECT_FALSE(evaluator.setFields(nullptr));
    EXPECT_FALSE(evaluator.setVariables(nullptr));
    EXPECT_TRUE(evaluator.setFields(&fields));
    EXPECT_TRUE(evaluator.setVariables(&variables));
}

TEST_F(CriteriaTest, CheckUsesBoundSourcesForNullArguments) {
    CriteriaEvaluator evaluator(L"[A]==pathid");
    ASSERT_TRUE(evaluator.setFields(&fields));
    ASSERT_TRUE(evaluator.setVariables(&variables));
    static_cast<Int32Field*>(variables.name(L"pathid"))->value(1);
    EXPECT_EQ(1, evaluator.check(true));
    static_cast<Int32Field*>(variables.name(L"pathid"))->value(2);
    EXPECT_EQ(0, evaluator.check(true));
    Fields other;
    other.add(L"A", FIELD_INT32);
    static_cast<Int32Field*>(other.name(L"A"))->value(2);
    EXPECT_EQ(1, evaluator.check(&other, nullptr, true));
}

TEST_F(CriteriaTest, FirstCheckParsesAndLaterChecksWalkTheTree) {
    CriteriaEvaluator evaluator(L"count([A]) == 1");
    CountCommand count;
    ASSERT_TRUE(evaluator.addCmd(L"count", 0, 0, &count));
    EXPECT_TRUE(evaluator.findCmd(L"count", 0));
    ASSERT_TRUE(evaluator.setFields(&fields));
    {
        testsupport::TraceCapture capture;
        EXPECT_EQ(1, evaluator.check(true));
        EXPECT_TRUE(capture.contains("executing command[count]"));
    }
    setA(5);
    {
        testsupport::TraceCapture capture;
        EXPECT_EQ(0, evaluator.check(true));
        // The walk never goes through the parser's factor.
        EXPECT_FALSE(capture.contains("executing command[count]"));
    }
    EXPECT_EQ(2, count.calls);
    EXPECT_FALSE(evaluator.hasFailed());
}

TEST_F(CriteriaTest, CheckReturnsTheLow32Bits) {
    CriteriaEvaluator big(L"4294967298");
    EXPECT_EQ(2, big.check(true));
    CriteriaEvaluator value(L"[A]+6");
    value.setFields(&fields);
    EXPECT_EQ(7, value.check(true));
}

TEST_F(CriteriaTest, FailureGivesMinusOne) {
    CriteriaEvaluator evaluator(L"[NOPE]==1");
    evaluator.setFields(&fields);
    EXPECT_EQ(-1, evaluator.check(true));
    EXPECT_TRUE(evaluator.hasFailed());
}

TEST_F(CriteriaTest, AfterAFailedFirstParseLaterChecksWalkWhatStands) {
    CriteriaEvaluator evaluator(L"[A] 2");
    evaluator.setFields(&fields);
    EXPECT_EQ(-1, evaluator.check(true));
    // The tree holds the leaf [A] that was read before the failure.
    EXPECT_EQ(1, evaluator.check(true));
    setA(9);
    EXPECT_EQ(9, evaluator.check(true));
}

TEST_F(CriteriaTest, CaseFlagReachesTheComparison) {
    CriteriaEvaluator evaluator(L"[S]==\"ABC\"");
    evaluator.setFields(&fields);
    EXPECT_EQ(1, evaluator.check(false));
    EXPECT_EQ(0, evaluator.check(true));
}

// ---------------------------------------------------------------- hash candidates

namespace {

struct Candidate {
    const wchar_t* expression;
    const wchar_t* name;  // null: no candidate
    char type;
    unsigned long long number;
    const wchar_t* text;
};

}  // namespace

TEST_F(CriteriaTest, HashCandidates) {
    const Candidate cases[] = {
        {L"[A]==1", L"A", 0, 1, nullptr},
        {L"1==[A]", L"A", 0, 1, nullptr},
        {L"[A]==1 && [B]==2", L"A", 0, 1, nullptr},
        {L"[B]==2 && [A]==1", L"B", 0, 2, nullptr},
        {L"[A]==1 || [B]==2", nullptr, 0, 0, nullptr},
        {L"[A]==1 || 1", nullptr, 0, 0, nullptr},
        {L"[S]==\"x*\"", nullptr, 0, 0, nullptr},
        {L"[S]==\"x?\"", nullptr, 0, 0, nullptr},
        {L"[S]==\"abc\"", L"S", 1, 0, L"abc"},
        {L"\"x*\"==[S]", L"S", 1, 0, L"x*"},
        {L"[S]=={\"abc\"}", nullptr, 0, 0, nullptr},
        {L"[A]==[B]", nullptr, 0, 0, nullptr},
        {L"[PATHID]==pathid", nullptr, 0, 0, nullptr},
        {L"pathid==[PATHID]", nullptr, 0, 0, nullptr},
        {L"pathid==7", L"pathid", 0, 7, nullptr},
        {L"[A]>1", nullptr, 0, 0, nullptr},
        {L"[A]!=1", nullptr, 0, 0, nullptr},
        {L"!([A]==1)", nullptr, 0, 0, nullptr},
        {L"([A]==1 || [B]==2) && [C]==3", L"C", 0, 3, nullptr},
        {L"[C]==3 && ([A]==1 || [B]==2)", L"C", 0, 3, nullptr},
        {L"[A]+1==3", nullptr, 0, 0, nullptr},
        {L"-[A]==1", nullptr, 0, 0, nullptr},
        {L"+[A]==1", L"A", 0, 1, nullptr},
        {L"[A]==1+2", L"A", 0, 3, nullptr},
        {L"[A]==0-1", L"A", 0, 0xFFFFFFFFFFFFFFFFULL, nullptr},
        {L"[A]==-1", L"A", 0, 0xFFFFFFFFFFFFFFFFULL, nullptr},
        {L"([A])==5", L"A", 0, 5, nullptr},
        {L"[A]==1 && [A]==2", L"A", 0, 1, nullptr},
        {L"[A]==1==1", L"A", 0, 1, nullptr},
        {L"1==1==[A]", L"A", 0, 1, nullptr},
        {L"1==1", nullptr, 0, 0, nullptr},
        {L"[S]==up(1)", nullptr, 0, 0, nullptr},
        {L"[S]==\"a\"+\"b\"", L"S", 1, 0, L"ab"},
        {L"[A]==1 && ([B]==2 || [C]==3) && [C]==4", L"A", 0, 1, nullptr},
    };
    for (const Candidate& c : cases) {
        std::wstring wide(c.expression);
        std::string label(wide.begin(), wide.end());
        CriteriaEvaluator evaluator(c.expression);
        UpperCommand up;
        ASSERT_TRUE(evaluator.addCmd(L"up", 1, 0, &up));
        ASSERT_TRUE(evaluator.setFields(&fields));
        ASSERT_TRUE(evaluator.setVariables(&variables));
        ExpValue* info = evaluator.getHashInfo();
        EXPECT_FALSE(evaluator.hasFailed()) << label;
        if (c.name == nullptr) {
            EXPECT_EQ(nullptr, info) << label;
            continue;
        }
        ASSERT_NE(nullptr, info) << label;
        EXPECT_STREQ(c.name, info->getNValueString()) << label;
        EXPECT_EQ(c.type, info->getType()) << label;
        if (c.text != nullptr) {
            EXPECT_STREQ(c.text, info->getStringValue()) << label;
        } else {
            EXPECT_EQ(c.number, info->number) << label;
        }
        // The same object comes back.
        EXPECT_EQ(info, evaluator.getHashInfo()) << label;
    }
}

TEST_F(CriteriaTest, HashInfoWithoutFieldsIsNull) {
    CriteriaEvaluator evaluator(L"[A]==1");
    EXPECT_EQ(nullptr, evaluator.getHashInfo());
    // Nothing was parsed: binding fields later still finds the candidate.
    evaluator.setFields(&fields);
    ExpValue* info = evaluator.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"A", info->getNValueString());
}

TEST_F(CriteriaTest, NoCandidateIsNullOnceThenTheEmptyValue) {
    CriteriaEvaluator evaluator(L"[A]>1");
    evaluator.setFields(&fields);
    EXPECT_EQ(nullptr, evaluator.getHashInfo());
    ExpValue* kept = evaluator.getHashInfo();
    ASSERT_NE(nullptr, kept);
    EXPECT_FALSE(kept->hasName());
}

TEST_F(CriteriaTest, HashInfoParseRunsNoCommandAndLeavesTheTreeForChecks) {
    CriteriaEvaluator evaluator(L"[S]==\"abc\" && path(1,\"x\")==\"/data/*\"");
    PathCommand path;
    ASSERT_TRUE(evaluator.addCmd(L"path", 1, 0, 1, &path));
    EXPECT_TRUE(evaluator.findCmd(L"path", 0, 1));
    evaluator.setFields(&fields);
    testsupport::TraceCapture capture;
    ExpValue* info = evaluator.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"S", info->getNValueString());
    EXPECT_EQ(0, path.calls);
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - command[path]: resetting factorValue [1]!\n"));
    // The first check walks the tree the hash pass left, and runs the command.
    EXPECT_EQ(1, evaluator.check(true));
    EXPECT_EQ(1, path.calls);
    // Only the hash pass went through the parser.
    EXPECT_EQ(1u, capture.count("SyntaxAnalyzer::factor - executing command[path]...\n"));
}

TEST_F(CriteriaTest, HashInfoAfterACheckReusesThatParse) {
    CriteriaEvaluator evaluator(L"[A]==1");
    evaluator.setFields(&fields);
    EXPECT_EQ(1, evaluator.check(true));
    ExpValue* info = evaluator.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"A", info->getNValueString());
}

TEST_F(CriteriaTest, SetHashInfoForcesALookupValue) {
    CriteriaEvaluator evaluator(L"[PATHID]==pathid");
    evaluator.setFields(&fields);
    evaluator.setVariables(&variables);
    ExpValue forced;
    forced.setNValueString(L"PATHID");
    forced.setNumericValue(17);
    ASSERT_TRUE(evaluator.setHashInfo(forced));
    ExpValue* info = evaluator.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"PATHID", info->getNValueString());
    EXPECT_EQ(17u, info->number);
    forced.setNumericValue(18);
    ASSERT_TRUE(evaluator.setHashInfo(forced));
    EXPECT_EQ(info, evaluator.getHashInfo());
    EXPECT_EQ(18u, info->number);
    // Checks are not disturbed by it.
    static_cast<Int32Field*>(fields.name(L"PATHID"))->value(18);
    static_cast<Int32Field*>(variables.name(L"pathid"))->value(18);
    EXPECT_EQ(1, evaluator.check(true));
}

TEST_F(CriteriaTest, SecondEvaluatorLeavesTheFirstsCommandsGone) {
    CriteriaEvaluator first(L"count(3)");
    CountCommand count;
    ASSERT_TRUE(first.addCmd(L"count", 0, 0, &count));
    EXPECT_EQ(3, first.check(true));
    CriteriaEvaluator second(L"1");
    EXPECT_FALSE(second.findCmd(L"count", 0));
    EXPECT_EQ(-1, first.check(true));
}

// ---------------------------------------------------------------- Evaluator

TEST(EvaluatorTest, Values) {
    struct Case {
        const wchar_t* text;
        bool value;
    } cases[] = {
        {L"1", true},         {L"0", false},         {L"1&0", false},     {L"1&1", true},
        {L"1|0", true},       {L"0|0", false},       {L"!0", true},       {L"!1", false},
        {L"!0&0", true},      {L"!1|1", false},      {L"(1)", true},      {L"((0))", false},
        {L"(1|0)&1", true},   {L"(1|0)&0", false},   {L"0|1&0", false},   {L"1|0&0", true},
        {L"(!1)|1", true},    {L"!(0)&1", true},    {L"1&1&1|0", true},  {L"0&1|0&1", false},
    };
    for (const Case& c : cases) {
        Evaluator evaluator;
        std::wstring wide(c.text);
        EXPECT_EQ(c.value, evaluator.execute(c.text)) << std::string(wide.begin(), wide.end());
        EXPECT_FALSE(evaluator.error()) << std::string(wide.begin(), wide.end());
    }
}

TEST(EvaluatorTest, MalformedTextSetsTheError) {
    const wchar_t* cases[] = {L"", L"2", L"1&", L"(1", L"1)", L"1 ", L" 1", L"1|x", L"0&2",
                              L"()", L"!", L"11", L"1&&1"};
    for (const wchar_t* text : cases) {
        Evaluator evaluator;
        std::wstring wide(text);
        EXPECT_FALSE(evaluator.execute(text)) << std::string(wide.begin(), wide.end());
        EXPECT_TRUE(evaluator.error()) << std::string(wide.begin(), wide.end());
    }
}

TEST(EvaluatorTest, NullTextSetsTheError) {
    Evaluator evaluator;
    EXPECT_FALSE(evaluator.execute(nullptr));
    EXPECT_TRUE(evaluator.error());
}

TEST(EvaluatorTest, ErrorIsClearedByTheNextExecute) {
    Evaluator evaluator;
    EXPECT_FALSE(evaluator.execute(L"2"));
    EXPECT_TRUE(evaluator.error());
    EXPECT_TRUE(evaluator.execute(L"1"));
    EXPECT_FALSE(evaluator.error());
}

TEST(EvaluatorTest, DeepNestingIsRefused) {
    Evaluator evaluator;
    std::wstring ok = std::wstring(500, L'(') + L"1" + std::wstring(500, L')');
    EXPECT_TRUE(evaluator.execute(ok.c_str()));
    std::wstring deep = std::wstring(200000, L'(') + L"1" + std::wstring(200000, L')');
    EXPECT_FALSE(evaluator.execute(deep.c_str()));
    EXPECT_TRUE(evaluator.error());
    std::wstring negations = std::wstring(200000, L'!') + L"1";
    EXPECT_FALSE(evaluator.execute(negations.c_str()));
    EXPECT_TRUE(evaluator.error());
}

TEST(CriteriaHashTest, TextColumnAgainstAWildcardMakesNoCandidate) {
    Fields fields;
    fields.add(L"A", FIELD_TEXT);
    static_cast<TextField*>(fields.name(L"A"))->value(L"xyz");
    CriteriaEvaluator wildcard(L"[A]==\"x*\"");
    wildcard.setFields(&fields);
    EXPECT_EQ(nullptr, wildcard.getHashInfo());
    EXPECT_EQ(1, wildcard.check(true));
    CriteriaEvaluator plain(L"[A]==\"xyz\"");
    plain.setFields(&fields);
    ExpValue* info = plain.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"A", info->getNValueString());
    EXPECT_STREQ(L"xyz", info->getStringValue());
    EXPECT_EQ(EXP_STRING, info->getType());
}

TEST(CriteriaExample, SetSizeAndAttributeExpressionOverChangingFields) {
    Fields fields;
    fields.add(L"FILENAME", FIELD_TEXT);
    fields.add(L"SIZE", FIELD_INT64);
    fields.add(L"ATTR", FIELD_INT32);
    CriteriaEvaluator evaluator(L"[FILENAME]=={\"*.so\",\"lib*.a\"} && [SIZE]>1024 || [ATTR]&1==0");
    ASSERT_TRUE(evaluator.setFields(&fields));
    // The set and the disjunction leave nothing for an index to look up.
    EXPECT_EQ(nullptr, evaluator.getHashInfo());
    struct Row {
        const wchar_t* name;
        unsigned long long size;
        unsigned int attr;
        int expected;
    } rows[] = {
        {L"libc.so", 2048, 1, 1},    // in the set, big
        {L"libc.so", 1024, 1, 0},    // in the set, not above 1024
        {L"libz.a", 5000, 1, 1},     // "lib*.a"
        {L"z.a", 5000, 1, 0},        // not "lib*.a"
        {L"libz.ar", 5000, 1, 0},    // "lib*.a" must end in ".a"
        {L"LIBZ.A", 5000, 1, 0},     // sets compare with case
        {L"x.so.1", 5000, 1, 0},     // "*.so" must end the name
        {L".so", 5000, 1, 1},        // the tail alone
        {L"notes.txt", 10, 0, 1},    // attribute bit 0 clear
        {L"notes.txt", 10, 2, 1},
        {L"notes.txt", 10, 3, 0},
        {L"libc.so", 10, 0, 1},
        {L"libc.so", 0x100000000ULL, 1, 1},
    };
    for (const Row& row : rows) {
        static_cast<TextField*>(fields.name(L"FILENAME"))->value(row.name);
        static_cast<Int64Field*>(fields.name(L"SIZE"))->value(row.size);
        static_cast<Int32Field*>(fields.name(L"ATTR"))->value(row.attr);
        std::wstring wide(row.name);
        EXPECT_EQ(row.expected, evaluator.check(true))
            << std::string(wide.begin(), wide.end()) << " " << row.size << " " << row.attr;
        EXPECT_FALSE(evaluator.hasFailed());
    }
    // The first pass over the text gives the same answers as the walks.
    for (const Row& row : rows) {
        CriteriaEvaluator fresh(evaluator.getCriteria());
        ASSERT_TRUE(fresh.setFields(&fields));
        static_cast<TextField*>(fields.name(L"FILENAME"))->value(row.name);
        static_cast<Int64Field*>(fields.name(L"SIZE"))->value(row.size);
        static_cast<Int32Field*>(fields.name(L"ATTR"))->value(row.attr);
        EXPECT_EQ(row.expected, fresh.check(true));
    }
}

TEST_F(CriteriaTest, HashPassSetsHashOnlyJustAroundItsParse) {
    CriteriaEvaluator evaluator(L"[A]==1 && count(2)==2");
    CountCommand count;
    ASSERT_TRUE(evaluator.addCmd(L"count", 0, 0, &count));
    ASSERT_TRUE(evaluator.setFields(&fields));
    ASSERT_NE(nullptr, evaluator.getAnalyzer());
    EXPECT_FALSE(evaluator.getAnalyzer()->getHashOnly());
    ExpValue* info = evaluator.getHashInfo();
    ASSERT_NE(nullptr, info);
    EXPECT_STREQ(L"A", info->getNValueString());
    EXPECT_EQ(0, count.calls);
    EXPECT_FALSE(evaluator.getAnalyzer()->getHashOnly());
    EXPECT_EQ(1, evaluator.check(true));
    EXPECT_EQ(1, count.calls);
}
