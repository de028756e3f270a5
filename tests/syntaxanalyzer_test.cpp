// The parser: tree shapes, short circuits, hash-only passes, the bookkeeping
// of simple expressions, and failures that must end cleanly.
#include <gtest/gtest.h>

#include <cwchar>
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

class CountCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        ++calls;
        result.setNumericValue(argument.number);
        return 0;
    }
    int calls = 0;
};

class PairCommand : public BinaryCmd {
public:
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        ++calls;
        result.setNumericValue(first.number * 10 + second.number);
        return 0;
    }
    int calls = 0;
};

class NameCommand : public UnaryCmd {
public:
    int execute(ExpValue const&, ExpValue& result) override {
        result.setString(L"named");
        return 0;
    }
};

class SyntaxAnalyzerTest : public ::testing::Test {
protected:
    SyntaxAnalyzerTest() {
        fields.add(L"A", FIELD_INT32);
        fields.add(L"B", FIELD_INT32);
        fields.add(L"C", FIELD_INT32);
        fields.add(L"S", FIELD_TEXT);
        fields.add(L"D", FIELD_INT64);
        setA(1);
        static_cast<TextField*>(fields.name(L"S"))->value(L"abc");
    }
    void setA(unsigned int v) { static_cast<Int32Field*>(fields.name(L"A"))->value(v); }
    void setD(unsigned long long v) { static_cast<Int64Field*>(fields.name(L"D"))->value(v); }

    Fields fields;
};

}  // namespace

// ---------------------------------------------------------------- Tree

TEST(TreeTest, NewTreeIsEmptyAndSetRootMakesALeaf) {
    Tree tree;
    EXPECT_EQ(nullptr, tree.getRoot());
    EXPECT_FALSE(tree.preVisit(tree.getRoot()));
    TreeNode* root = tree.setRoot();
    ASSERT_NE(nullptr, root);
    EXPECT_EQ(root, tree.getRoot());
    EXPECT_TRUE(tree.isLeaf(root));
    EXPECT_FALSE(tree.isLeaf(nullptr));
    EXPECT_EQ(255, root->token.type);
    EXPECT_TRUE(tree.preVisit(root));
}

TEST(TreeTest, MergePutsOldRootLeftAndOtherRootRightAndEmptiesOther) {
    Tree left;
    Tree right;
    fsToken one;
    one.setType(0);
    one.setNumericValue(1);
    fsToken two = one;
    two.setNumericValue(2);
    left.setData(left.setRoot(), one);
    right.setData(right.setRoot(), two);
    TreeNode* oldLeft = left.getRoot();
    TreeNode* oldRight = right.getRoot();
    left.merge(&right);
    EXPECT_EQ(nullptr, right.getRoot());
    ASSERT_NE(nullptr, left.getRoot());
    EXPECT_EQ(oldLeft, left.getLeft(left.getRoot()));
    EXPECT_EQ(oldRight, left.getRight(left.getRoot()));
    EXPECT_TRUE(left.preVisit(left.getRoot()));
}

TEST(TreeTest, MergeIntoEmptyTreeHasNoLeftChild) {
    Tree empty;
    Tree other;
    other.setRoot();
    empty.merge(&other);
    ASSERT_NE(nullptr, empty.getRoot());
    EXPECT_EQ(nullptr, empty.getLeft(empty.getRoot()));
    EXPECT_NE(nullptr, empty.getRight(empty.getRoot()));
    // One child only: preVisit says no.
    EXPECT_FALSE(empty.preVisit(empty.getRoot()));
}

TEST(TreeTest, ChildSettersAndSetData) {
    Tree tree;
    TreeNode* root = tree.setRoot();
    fsToken token;
    token.setType(3);
    token.setStringValue(L"v");
    TreeNode* left = tree.setLeftTreeNode(root, token);
    ASSERT_NE(nullptr, left);
    EXPECT_STREQ(L"v", left->token.getStringValue());
    EXPECT_FALSE(tree.preVisit(root));
    TreeNode* right = tree.setRightTreeNode(root);
    ASSERT_NE(nullptr, right);
    EXPECT_TRUE(tree.preVisit(root));
    EXPECT_FALSE(tree.isLeaf(root));
    EXPECT_TRUE(tree.setData(right, token));
    EXPECT_FALSE(tree.setData(nullptr, token));
    EXPECT_EQ(nullptr, tree.setLeftTreeNode(nullptr));
    TreeNode* loose = tree.createTreeNode();
    ASSERT_NE(nullptr, loose);
    EXPECT_TRUE(tree.isLeaf(loose));
    delete loose;
    // Replacing a child releases the old one (checked by the leak checker).
    tree.setLeftTreeNode(root);
    EXPECT_TRUE(tree.isLeaf(tree.getLeft(root)));
}

TEST(TreeTest, FreeOfRootEmptiesTheTree) {
    Tree tree;
    tree.setLeftTreeNode(tree.setRoot());
    tree.free(tree.getRoot());
    EXPECT_EQ(nullptr, tree.getRoot());
}

// ---------------------------------------------------------------- tree shapes

TEST_F(SyntaxAnalyzerTest, BinaryOperatorHasItsTokenAtTheRoot) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"1+2", &fields, nullptr, result, true));
    Tree* tree = analyzer.getTree();
    TreeNode* root = tree->getRoot();
    EXPECT_EQ(4, root->token.type);
    EXPECT_EQ(0u, root->token.numericValue);
    EXPECT_EQ(1u, root->left->token.numericValue);
    EXPECT_EQ(2u, root->right->token.numericValue);
    EXPECT_TRUE(tree->isLeaf(root->left));
    EXPECT_TRUE(tree->isLeaf(root->right));
}

TEST_F(SyntaxAnalyzerTest, ChainsAreLeftDeep) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"1-2-3", &fields, nullptr, result, true));
    TreeNode* root = analyzer.getTree()->getRoot();
    EXPECT_EQ(2u, root->token.numericValue);
    EXPECT_EQ(3u, root->right->token.numericValue);
    EXPECT_EQ(4, root->left->token.type);
    EXPECT_EQ(1u, root->left->left->token.numericValue);
    EXPECT_EQ(-4LL, static_cast<long long>(result.number));
}

TEST_F(SyntaxAnalyzerTest, ParenthesisAddsNoNode) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"((7))", &fields, nullptr, result, true));
    TreeNode* root = analyzer.getTree()->getRoot();
    EXPECT_TRUE(analyzer.getTree()->isLeaf(root));
    EXPECT_EQ(0, root->token.type);
    EXPECT_EQ(7u, root->token.numericValue);
}

TEST_F(SyntaxAnalyzerTest, UnaryOperatorsKeepOperandLeftAndAnEmptyLeafRight) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"-5", &fields, nullptr, result, true));
    TreeNode* root = analyzer.getTree()->getRoot();
    EXPECT_EQ(4, root->token.type);
    EXPECT_EQ(3u, root->token.numericValue);  // unary minus
    EXPECT_EQ(5u, root->left->token.numericValue);
    ASSERT_NE(nullptr, root->right);
    EXPECT_EQ(255, root->right->token.type);
    EXPECT_TRUE(analyzer.getTree()->isLeaf(root->right));

    ASSERT_FALSE(analyzer.parse(L"+5", &fields, nullptr, result, true));
    EXPECT_EQ(1u, analyzer.getTree()->getRoot()->token.numericValue);  // unary plus

    ASSERT_FALSE(analyzer.parse(L"!0", &fields, nullptr, result, true));
    root = analyzer.getTree()->getRoot();
    EXPECT_EQ(6, root->token.type);
    EXPECT_EQ(2u, root->token.numericValue);
    EXPECT_EQ(255, root->right->token.type);
    EXPECT_TRUE(analyzer.getTree()->preVisit(root));
}

TEST_F(SyntaxAnalyzerTest, CommandHasItsTokenAtTheRootAndArgumentsBelow) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    PairCommand pair;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ASSERT_TRUE(analyzer.addCmdToken(L"pair", 0, 0, 0, &pair));
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"count(4)", &fields, nullptr, result, true));
    TreeNode* root = analyzer.getTree()->getRoot();
    EXPECT_EQ(8, root->token.type);
    EXPECT_EQ(0u, root->token.numericValue);
    EXPECT_EQ(4u, root->left->token.numericValue);
    EXPECT_EQ(255, root->right->token.type);

    ASSERT_FALSE(analyzer.parse(L"pair(1,2)", &fields, nullptr, result, true));
    root = analyzer.getTree()->getRoot();
    EXPECT_EQ(8, root->token.type);
    EXPECT_EQ(1u, root->token.numericValue);
    EXPECT_EQ(1u, root->left->token.numericValue);
    EXPECT_EQ(2u, root->right->token.numericValue);
    EXPECT_EQ(12u, result.number);
}

// ---------------------------------------------------------------- failures

TEST_F(SyntaxAnalyzerTest, EmptyExpressionFailsWithUnexpectedSequence) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"", &fields, nullptr, result, true));
    EXPECT_EQ(1u, capture.count("SyntaxAnalyzer::factor - unexpected sequence!\n"));
    EXPECT_EQ(1u, capture.messages().size());
}

TEST_F(SyntaxAnalyzerTest, NullTextFailsWithUnexpectedSequence) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(nullptr, &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - unexpected sequence!\n"));
}

TEST_F(SyntaxAnalyzerTest, TwoNumbersFailWithExpectedOperator) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"1 2", &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::parse - expected operator.\n"));
    EXPECT_TRUE(analyzer.getError());
}

TEST_F(SyntaxAnalyzerTest, TrailingBlankFailsWithExpectedOperator) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"[A]==1 ", &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::parse - expected operator.\n"));
    // Without the blank it is fine.
    EXPECT_FALSE(analyzer.parse(L"[A]==1", &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
}

TEST_F(SyntaxAnalyzerTest, MixedTypesFailByTheirLevelsMessages) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    {
        testsupport::TraceCapture capture;
        EXPECT_TRUE(analyzer.parse(L"\"a\" + 1", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains(
            "SyntaxAnalyzer::expression - expression operands of different types or not NUMERIC\n"));
    }
    {
        testsupport::TraceCapture capture;
        EXPECT_TRUE(analyzer.parse(L"1 && \"a\"", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains(
            "SyntaxAnalyzer::bTerm - bTerm operands of different types or not NUMERIC\n"));
    }
}

TEST_F(SyntaxAnalyzerTest, SyntaxErrorOnTheDeadSideStillFails) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"0 && (1 +)", &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - unexpected sequence!\n"));
    EXPECT_TRUE(analyzer.parse(L"1 || \"a\" == 2", &fields, nullptr, result, true));
}

TEST_F(SyntaxAnalyzerTest, FailureLeavesEachLevelOneTraceLine) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"1 + (2 * \"x\") + 3", &fields, nullptr, result, true));
    EXPECT_EQ(1u, capture.messages().size()) << capture.dump();
}

TEST_F(SyntaxAnalyzerTest, TreeWalkWithoutParseFails) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    result.setNumericValue(77);
    EXPECT_TRUE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(77u, result.number);
}

TEST_F(SyntaxAnalyzerTest, DivisionByZeroFailsInBothPassesWithoutTouchingTheWalkResult) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    setD(0);
    {
        testsupport::TraceCapture capture;
        EXPECT_TRUE(analyzer.parse(L"10/[D]", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains("SyntaxAnalyzer::term - division by zero!\n"));
    }
    setD(5);
    ASSERT_FALSE(analyzer.parse(L"10/[D]", &fields, nullptr, result, true));
    EXPECT_EQ(2u, result.number);
    setD(0);
    ExpValue walked;
    walked.setNumericValue(99);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(99u, walked.number);
    EXPECT_TRUE(capture.contains("SyntaxTree::resolve - division by zero\n"));
    setD(2);
    EXPECT_FALSE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(5u, walked.number);
}

TEST_F(SyntaxAnalyzerTest, DeepNestingIsRefusedWithoutExhaustingTheStack) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring ok = std::wstring(99, L'(') + L"1" + std::wstring(99, L')');
    EXPECT_FALSE(analyzer.parse(ok.c_str(), &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    std::wstring deep = std::wstring(100000, L'(') + L"1" + std::wstring(100000, L')');
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(deep.c_str(), &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - expression nested too deeply!\n"));
    std::wstring negations = std::wstring(100000, L'!') + L"1";
    EXPECT_TRUE(analyzer.parse(negations.c_str(), &fields, nullptr, result, true));
}

TEST_F(SyntaxAnalyzerTest, LongChainIsWalkedWithoutRecursion) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring chain = L"1";
    for (int i = 1; i < 20000; ++i) {
        chain += L"+1";
    }
    ASSERT_FALSE(analyzer.parse(chain.c_str(), &fields, nullptr, result, true));
    EXPECT_EQ(20000u, result.number);
    ExpValue walked;
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(20000u, walked.number);
    EXPECT_TRUE(analyzer.getTree()->preVisit(analyzer.getTree()->getRoot()));
}

TEST_F(SyntaxAnalyzerTest, ConcatenationReachingTheLimitFails) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring fits = L"\"" + std::wstring(4194301, L'x') + L"\"+\"y\"";
    ASSERT_FALSE(analyzer.parse(fits.c_str(), &fields, nullptr, result, true));
    EXPECT_EQ(4194302u, result.getStringLength());
    ExpValue walked;
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(4194302u, walked.getStringLength());

    std::wstring tooLong = L"\"" + std::wstring(4194302, L'x') + L"\"+\"y\"";
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(tooLong.c_str(), &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains(
        "SyntaxAnalyzer::expression - string space not available for concatenation\n"));
}

TEST_F(SyntaxAnalyzerTest, OverlongLiteralFailsCleanly) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring text = L"\"a\" + \"" + std::wstring(4194304, L'x') + L"\"";
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(text.c_str(), &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - unexpected sequence!\n"));
    std::wstring alone = L"\"" + std::wstring(4194304, L'x') + L"\"";
    EXPECT_TRUE(analyzer.parse(alone.c_str(), &fields, nullptr, result, true));
}

TEST_F(SyntaxAnalyzerTest, OverlongFieldTextFailsInLValue) {
    Fields big;
    big.add(L"T", FIELD_TEXT);
    std::wstring text(4194304, L'z');
    static_cast<TextField*>(big.name(L"T"))->value(text.c_str());
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"[T]==\"z\"", &big, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxTree::l_value - string space not available\n"));
    text.resize(4194303);
    static_cast<TextField*>(big.name(L"T"))->value(text.c_str());
    EXPECT_FALSE(analyzer.parse(L"[T]==\"z*\"", &big, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
}

TEST_F(SyntaxAnalyzerTest, FieldsAndVariablesMustBeGiven) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"[A]==1", nullptr, nullptr, result, true));
    EXPECT_TRUE(analyzer.parse(L"A==1", &fields, nullptr, result, true));
    EXPECT_EQ(2u, capture.count("SyntaxAnalyzer::factor - variable specified not found!\n"));
    // A variable is found in the variables, not in the fields.
    EXPECT_FALSE(analyzer.parse(L"A==1", nullptr, &fields, result, true));
    EXPECT_EQ(1u, result.number);
}

// ---------------------------------------------------------------- short circuits and commands

TEST_F(SyntaxAnalyzerTest, CommandInADeadOperandIsNotRun) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"0 && count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(0u, result.number);
    ASSERT_FALSE(analyzer.parse(L"1 || count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    ASSERT_FALSE(analyzer.parse(L"0 && 1 && count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(0, count.calls);
    ASSERT_FALSE(analyzer.parse(L"1 && count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(1, count.calls);
    ASSERT_FALSE(analyzer.parse(L"0 || count(3)", &fields, nullptr, result, true));
    EXPECT_EQ(2, count.calls);
    EXPECT_EQ(1u, result.number);
}

TEST_F(SyntaxAnalyzerTest, TreeWalkShortCircuits) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"[A] && count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(1, count.calls);
    setA(0);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(0u, result.number);
    EXPECT_EQ(1, count.calls);
    setA(1);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    EXPECT_EQ(2, count.calls);
}

TEST_F(SyntaxAnalyzerTest, OrShortCircuitsInTheWalkOnlyForExactlyOne) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ExpValue result;
    setA(1);
    ASSERT_FALSE(analyzer.parse(L"[A] || count(1)", &fields, nullptr, result, true));
    EXPECT_EQ(0, count.calls);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(0, count.calls);
    // 2 is true as well, but the walk reads the right side.
    setA(2);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(1, count.calls);
    EXPECT_EQ(1u, result.number);
}

TEST_F(SyntaxAnalyzerTest, OrAsymmetryShowsOnAZeroDivisor) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"2 || 5/0", &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxTree::resolve - division by zero\n"));
}

TEST_F(SyntaxAnalyzerTest, ExecutingCommandIsTracedInTheFirstPassOnly) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ExpValue result;
    {
        testsupport::TraceCapture capture;
        ASSERT_FALSE(analyzer.parse(L"count(5)", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - executing command[count]...\n"));
    }
    testsupport::TraceCapture capture;
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_FALSE(capture.contains("executing command"));
    EXPECT_EQ(2, count.calls);
    EXPECT_EQ(5u, result.number);
}

TEST_F(SyntaxAnalyzerTest, HashOnlyPassRunsNoCommandAndResetsItsValue) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    NameCommand name;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ASSERT_TRUE(analyzer.addCmdToken(L"name", 1, 0, &name));
    analyzer.setHashOnly(true);
    EXPECT_TRUE(analyzer.getHashOnly());
    ExpValue result;
    {
        testsupport::TraceCapture capture;
        ASSERT_FALSE(analyzer.parse(L"count(5) + 1", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - executing command[count]...\n"));
        EXPECT_TRUE(capture.contains(
            "SyntaxAnalyzer::factor - command[count]: resetting factorValue [0]!\n"));
    }
    EXPECT_EQ(0, count.calls);
    EXPECT_EQ(1u, result.number);
    {
        testsupport::TraceCapture capture;
        ASSERT_FALSE(analyzer.parse(L"name(1)", &fields, nullptr, result, true));
        EXPECT_TRUE(capture.contains(
            "SyntaxAnalyzer::factor - command[name]: resetting factorValue [1]!\n"));
        EXPECT_EQ(EXP_STRING, result.getType());
        EXPECT_STREQ(L"", result.getStringValue());
    }
    analyzer.setHashOnly(false);
    ASSERT_FALSE(analyzer.parse(L"count(5) + 1", &fields, nullptr, result, true));
    analyzer.setHashOnly(true);
    // The tree walk runs commands whatever hashOnly says.
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(6u, result.number);
    EXPECT_EQ(2, count.calls);
}

TEST_F(SyntaxAnalyzerTest, SecondAnalyzerEmptiesTheCommandTable) {
    SyntaxAnalyzer first;
    CountCommand count;
    ASSERT_TRUE(first.addCmdToken(L"count", 0, 0, &count));
    ExpValue result;
    ASSERT_FALSE(first.parse(L"count(2)", &fields, nullptr, result, true));
    SyntaxAnalyzer second;
    EXPECT_TRUE(cmdTokenTable().empty());
    EXPECT_FALSE(SyntaxAnalyzer::findCmdToken(L"count", 0));
    // The first tree still holds the token number; the walk now fails cleanly.
    testsupport::TraceCapture capture;
    EXPECT_TRUE(first.parse(&fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxTree::resolve - command[count] not supported\n"));
    // And "count" is only a variable to the lexer now.
    EXPECT_TRUE(second.parse(L"count(2)", &fields, nullptr, result, true));
}

// ---------------------------------------------------------------- simple and orDepth

TEST_F(SyntaxAnalyzerTest, OrMakesTheExpressionNotSimple) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue candidate;
    ASSERT_FALSE(analyzer.parse(L"[A]==1", &fields, nullptr, result, true));
    EXPECT_TRUE(analyzer.isSimple());
    EXPECT_TRUE(analyzer.getHashValue(candidate));
    ASSERT_FALSE(analyzer.parse(L"[A]==1 || [B]==2", &fields, nullptr, result, true));
    EXPECT_FALSE(analyzer.isSimple());
    EXPECT_EQ(0u, analyzer.getOrDepth());
    EXPECT_FALSE(analyzer.getHashValue(candidate));
    ASSERT_FALSE(analyzer.parse(L"([A]==1 || [B]==2) && [C]==3", &fields, nullptr, result, true));
    EXPECT_TRUE(analyzer.isSimple());
    EXPECT_TRUE(analyzer.getHashValue(candidate));
    EXPECT_STREQ(L"C", candidate.getNValueString());
    ASSERT_FALSE(analyzer.parse(L"[A]==1 || [B]==2 && [C]==3", &fields, nullptr, result, true));
    EXPECT_FALSE(analyzer.isSimple());
    // A new parse starts simple again.
    ASSERT_FALSE(analyzer.parse(L"1", &fields, nullptr, result, true));
    EXPECT_TRUE(analyzer.isSimple());
}

TEST_F(SyntaxAnalyzerTest, CandidateBeforeADisjunctionStays) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue candidate;
    ASSERT_FALSE(analyzer.parse(L"[A]==1 && ([B]==2 || [C]==3)", &fields, nullptr, result, true));
    // The candidate stays, while the expression is simple again after the &&.
    ASSERT_TRUE(analyzer.getHashValue(candidate));
    EXPECT_STREQ(L"A", candidate.getNValueString());
    EXPECT_EQ(1u, candidate.number);
}

TEST_F(SyntaxAnalyzerTest, NegationDropsACandidateFoundInside) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ExpValue candidate;
    ASSERT_FALSE(analyzer.parse(L"!([A]==1)", &fields, nullptr, result, true));
    EXPECT_TRUE(analyzer.isSimple());
    EXPECT_FALSE(analyzer.getHashValue(candidate));
    ASSERT_FALSE(analyzer.parse(L"[B]==0 && !([A]==1)", &fields, nullptr, result, true));
    ASSERT_TRUE(analyzer.getHashValue(candidate));
    EXPECT_STREQ(L"B", candidate.getNValueString());
}

TEST_F(SyntaxAnalyzerTest, CaseFlagReachesTheComparisons) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"[S]==\"ABC\"", &fields, nullptr, result, false));
    EXPECT_EQ(1u, result.number);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(0u, result.number);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, false));
    EXPECT_EQ(1u, result.number);
}

TEST_F(SyntaxAnalyzerTest, SetOperandIsComputedOnceInTheWalk) {
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"[S]=={\"a*\"}", &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    TreeNode* right = analyzer.getTree()->getRoot()->right;
    ASSERT_NE(nullptr, right->token.lookup);
    EXPECT_EQ(nullptr, right->token.value.lookup);
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    EXPECT_EQ(right->token.lookup, right->token.value.lookup);
    static_cast<TextField*>(fields.name(L"S"))->value(L"xyz");
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, result, true));
    EXPECT_EQ(0u, result.number);
}

TEST_F(SyntaxAnalyzerTest, WalkWithAVariableOfAnotherTypeLeavesTheRelationAlone) {
    Fields numeric;
    numeric.add(L"v", FIELD_INT32);
    static_cast<Int32Field*>(numeric.name(L"v"))->value(1);
    Fields text;
    text.add(L"v", FIELD_TEXT);
    static_cast<TextField*>(text.name(L"v"))->value(L"1");
    SyntaxAnalyzer analyzer;
    ExpValue result;
    ASSERT_FALSE(analyzer.parse(L"v==1", nullptr, &numeric, result, true));
    EXPECT_EQ(1u, result.number);
    EXPECT_FALSE(analyzer.parse(nullptr, &text, result, true));
    EXPECT_EQ(0u, result.number);
}

// ---------------------------------------------------------------- bad input leaves no state behind

TEST_F(SyntaxAnalyzerTest, CommandWithAnUnsupportedArgumentCountFails) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    // addCmdToken only makes commands of one or two arguments; a table entry
    // of any other count can only be put there by hand.
    CmdToken odd;
    wcscpy(odd.name, L"odd");
    odd.argumentCount = 3;
    odd.returnType = 0;
    odd.argumentTypes = {0, 0, 0};
    odd.command.unary = &count;
    cmdTokenTable().push_back(odd);
    ExpValue result;
    result.setNumericValue(31);
    testsupport::TraceCapture capture;
    EXPECT_TRUE(analyzer.parse(L"odd(1)", &fields, nullptr, result, true));
    EXPECT_TRUE(capture.contains("SyntaxAnalyzer::factor - command specified (odd) n_args not supported!\n"))
        << capture.dump();
    EXPECT_EQ(1u, capture.messages().size()) << capture.dump();
    EXPECT_EQ(0, count.calls);
    EXPECT_EQ(31u, result.number);
    cmdTokenTable().clear();
}

TEST_F(SyntaxAnalyzerTest, FailedParseLeavesNoStateForTheNextOne) {
    SyntaxAnalyzer analyzer;
    CountCommand count;
    ASSERT_TRUE(analyzer.addCmdToken(L"count", 0, 0, &count));
    ExpValue candidate;
    // Each of these fails after a candidate was found, inside a disjunction,
    // or with commands half parsed.
    const wchar_t* broken[] = {L"[A]==1 && (",          L"[A]==1 || [B]==",
                               L"[A]==1 || count(\"x\")", L"[B]==2 && !([A]==",
                               L"\"abc",                  L"[A]==1 ",
                               L"1\t+ 2",                 L"[NOPE]==1",
                               L"count(1,2)",             L"{\"a\""};
    for (const wchar_t* text : broken) {
        std::wstring wide(text);
        std::string label(wide.begin(), wide.end());
        ExpValue result;
        EXPECT_TRUE(analyzer.parse(text, &fields, nullptr, result, true)) << label;
        EXPECT_TRUE(analyzer.getError()) << label;

        // The same analyzer then parses a good expression as a new one would.
        setA(1);
        ASSERT_FALSE(analyzer.parse(L"[B]==0 && [A]==1", &fields, nullptr, result, true)) << label;
        EXPECT_FALSE(analyzer.getError()) << label;
        EXPECT_EQ(1u, result.number) << label;
        EXPECT_TRUE(analyzer.isSimple()) << label;
        EXPECT_EQ(0u, analyzer.getOrDepth()) << label;
        ASSERT_TRUE(analyzer.getHashValue(candidate)) << label;
        EXPECT_STREQ(L"B", candidate.getNValueString()) << label;
        EXPECT_EQ(0u, candidate.number) << label;
        // The tree is that of the good expression alone.
        TreeNode* root = analyzer.getTree()->getRoot();
        ASSERT_NE(nullptr, root) << label;
        EXPECT_EQ(6, root->token.type) << label;
        EXPECT_EQ(0u, root->token.numericValue) << label;
        EXPECT_TRUE(analyzer.getTree()->preVisit(root)) << label;
        setA(2);
        ExpValue walked;
        ASSERT_FALSE(analyzer.parse(&fields, nullptr, walked, true)) << label;
        EXPECT_EQ(0u, walked.number) << label;
    }
    EXPECT_EQ(0, count.calls);
}

TEST_F(SyntaxAnalyzerTest, LongestStringLiteralIsParsedAndWalked) {
    // 4194303 characters is the most a literal may hold.
    std::wstring longest(4194303, L'x');
    static_cast<TextField*>(fields.name(L"S"))->value(longest.c_str());
    SyntaxAnalyzer analyzer;
    ExpValue result;
    std::wstring text = L"[S]==\"" + longest + L"\"";
    ASSERT_FALSE(analyzer.parse(text.c_str(), &fields, nullptr, result, true));
    EXPECT_EQ(1u, result.number);
    ExpValue candidate;
    ASSERT_TRUE(analyzer.getHashValue(candidate));
    EXPECT_EQ(4194303u, candidate.getStringLength());
    static_cast<TextField*>(fields.name(L"S"))->value(L"short");
    ExpValue walked;
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(0u, walked.number);

    std::wstring alone = L"\"" + longest + L"\"";
    ASSERT_FALSE(analyzer.parse(alone.c_str(), &fields, nullptr, result, true));
    EXPECT_EQ(EXP_STRING, result.getType());
    EXPECT_EQ(4194303u, result.getStringLength());
    ASSERT_FALSE(analyzer.parse(&fields, nullptr, walked, true));
    EXPECT_EQ(4194303u, walked.getStringLength());
}
