// The parser of the query language and the tree it builds.
//
// SyntaxAnalyzer is a recursive-descent parser that, in one pass, computes the
// value of an expression for the current fields and variables and builds a
// Tree of its tokens.  The first check of an expression goes through the
// text; later checks walk the tree (evaluateExp) and never touch the lexer.
//
// Grammar, loose to tight, every binary level a left-associative loop:
//   start       := bExpression <end>
//   bExpression := bTerm { "||" bTerm }
//   bTerm       := relation { "&&" relation }
//   relation    := expression { relop expression }     (== >= <= > < !=)
//   expression  := term { ("+" | "-" | "|") term }
//   term        := factor { ("*" | "/" | "&") factor }
//   factor      := number | string | set | field | variable
//                | "(" bExpression ")" | "!" factor | "+" factor | "-" factor
//                | command "(" bExpression [ "," bExpression ] ")"
//
// Every failure sets `error`, traces one line at traceMAX and unwinds; no
// exception leaves the analyzer.  Constructing an analyzer empties the
// process-wide command table.  One thread at a time.
#ifndef FSCANNER_FSCOMMON_SYNTAXANALYZER_H
#define FSCANNER_FSCOMMON_SYNTAXANALYZER_H

#include <cstdint>
#include <string>
#include <vector>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/lexer.h"

class Field;
class Fields;
class QvLogWrapper;

class TreeNode {
public:
    TreeNode() : left(nullptr), right(nullptr) {}
    TreeNode(const TreeNode&) = delete;
    TreeNode& operator=(const TreeNode&) = delete;

    TreeNode* left;
    TreeNode* right;
    // Kept for the record layout; the walk never reads it.
    std::vector<TreeNode*> children;
    fsToken token;
};

// A binary tree of tokens.  Owns its nodes.
class Tree {
public:
    Tree() : root(nullptr) {}
    ~Tree() { free(root); }
    Tree(const Tree&) = delete;
    Tree& operator=(const Tree&) = delete;

    // A new empty node becomes the root; an old root is released first.
    TreeNode* setRoot();
    TreeNode* getRoot() const { return root; }
    TreeNode* getLeft(TreeNode* node) const { return node != nullptr ? node->left : nullptr; }
    TreeNode* getRight(TreeNode* node) const { return node != nullptr ? node->right : nullptr; }
    // True for a node without children (false for null).
    bool isLeaf(TreeNode* node) const;
    // Copies token into node; false for a null node.
    bool setData(TreeNode* node, fsToken const& token);
    // A new empty (or token-holding) node as the left or right child of node;
    // an old child there is released.  Null for a null node.
    TreeNode* setLeftTreeNode(TreeNode* node);
    TreeNode* setLeftTreeNode(TreeNode* node, fsToken const& token);
    TreeNode* setRightTreeNode(TreeNode* node);
    TreeNode* setRightTreeNode(TreeNode* node, fsToken const& token);
    // A new empty node, owned by the caller until it is linked in.
    TreeNode* createTreeNode();
    // A new root whose left child is this tree's old root (none when this
    // tree was empty) and whose right child is other's root; other is left
    // empty.  A null other merges an empty tree.
    void merge(Tree* other);
    // False for null, true for a leaf, else true when both children give
    // true: so true exactly when no node below has a single child.
    bool preVisit(TreeNode* node) const;
    // Releases node and everything below it, depth first.  The caller
    // unlinks it (free(getRoot()) must be followed by a new root).
    void free(TreeNode* node);

private:
    TreeNode* root;
};

class SyntaxAnalyzer {
public:
    // Nesting of factors (parentheses, unary operators, command arguments)
    // allowed before an expression is refused, so that the recursion can't
    // exhaust the stack.
    static constexpr unsigned int MAX_NESTING = 100;

    // Empties the process-wide command table.
    SyntaxAnalyzer();
    ~SyntaxAnalyzer();
    SyntaxAnalyzer(const SyntaxAnalyzer&) = delete;
    SyntaxAnalyzer& operator=(const SyntaxAnalyzer&) = delete;

    // Parses text, evaluates it directly for fields and variables and keeps
    // the tree.  Returns the error flag: false is success.  result is
    // written as the pass goes; on failure it holds whatever was reached.
    bool parse(wchar_t const* text, Fields* fields, Fields* variables, ExpValue& result,
               bool caseSensitive);
    // Evaluates the stored tree.  Returns the error flag; result is written
    // only on success.  Without a tree the flag is set.
    bool parse(Fields* fields, Fields* variables, ExpValue& result, bool caseSensitive);

    // The grammar levels.  `evaluate` is false in the dead operand of a short
    // circuit; each level adds its nodes through `tree`.  Operators and type
    // checks run in a dead operand too, but a command there is not run (its
    // value is the empty value of its return type, as under hashOnly) and a
    // zero divisor there gives 0 instead of failing, since the value is
    // never used.
    void bExpression(ExpValue& value, bool evaluate, Tree** tree);
    void bTerm(ExpValue& value, bool evaluate, Tree** tree);
    void relation(ExpValue& value, bool evaluate, Tree** tree);
    void expression(ExpValue& value, bool evaluate, Tree** tree);
    void term(ExpValue& value, bool evaluate, Tree** tree);
    void factor(ExpValue& value, bool evaluate, Tree** tree);

    // Command registration on the process-wide table.  False for a null or
    // empty name, a null command, a name of more than 32 characters, a type
    // code above 1, or when the name exists with the same argument types.
    static bool addCmdToken(wchar_t const* name, char returnType, char argumentType,
                            UnaryCmd* command);
    static bool addCmdToken(wchar_t const* name, char returnType, char firstType, char secondType,
                            BinaryCmd* command);
    // True when a command of that name has these first argument types.
    static bool findCmdToken(wchar_t const* name, char argumentType);
    static bool findCmdToken(wchar_t const* name, char firstType, char secondType);

    // Value of a leaf token.  False (with `error` set) on failure.
    bool l_value(fsToken& token, ExpValue& value);
    // Applies one operator token.  False (with `error` set) on failure.
    bool resolve(fsToken& operatorToken, ExpValue& left, ExpValue& right, ExpValue& result);
    // Value of a tree; the empty value for null or once `error` is set.
    ExpValue evaluateExp(TreeNode* node);

    // True, with a copy in out, when the expression is simple and the last
    // parse found a hash candidate with a column name.
    bool getHashValue(ExpValue& out);

    void setHashOnly(bool value) { hashOnly = value; }
    bool getHashOnly() const { return hashOnly; }
    bool isSimple() const { return simple; }
    uint32_t getOrDepth() const { return orDepth; }
    bool getError() const { return error; }
    // Why the last pass failed, for a person: the traced message without its
    // "Class::function - " head and line end, e.g. "unexpected sequence!" or
    // "expected operator.".  Empty when the last pass succeeded.
    std::string getErrorText() const;
    Tree* getTree() const { return tree; }

    // One node of a tree walk in progress.  The walk keeps its own stack so
    // that a long chain such as 1+1+...+1, whose tree is as deep as it is
    // long, can't exhaust the machine stack.
    struct WalkFrame {
        TreeNode* node = nullptr;
        int stage = 0;
        bool cachedSet = false;
        ExpValue left;
    };

private:
    // Keeps message (formatted as traced) as the text of the failure that
    // just set `error`.  The analyzer's layout has no room for it: the text
    // stands in a table of the process keyed by the analyzer, and the
    // destructor removes it.
    void noteError(std::string const& message);
    // Makes the hash candidate of `left == right` when there is none yet.
    void captureCandidate(ExpValue const& left, ExpValue const& right);
    // Runs a command of the table on evaluated arguments (tree walk).
    bool runCommand(fsToken& token, ExpValue& first, ExpValue& second, ExpValue& result);
    Field* findField(fsToken const& token);

    Lexer* lexer;
    bool error;
    Fields* fields;
    Fields* variables;
    bool caseSensitive;
    ExpValue hashValue;
    uint32_t orDepth;
    bool simple;
    Tree* tree;
    QvLogWrapper* trace;
    bool hashOnly;
    // Factors on the recursion stack of the current pass.
    unsigned int nesting;
    // The frames of evaluateExp, kept from walk to walk; walking is set
    // while the outermost walk runs.
    std::vector<WalkFrame> walkFrames;
    bool walking = false;
};

#endif
