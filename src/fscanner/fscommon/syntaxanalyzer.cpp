#include "fscanner/fscommon/syntaxanalyzer.h"

#include <cwchar>
#include <map>
#include <mutex>
#include <string>

#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/syntaxfail.h"
#include "fscanner/fscommon/wildcard.h"

// ---------------------------------------------------------------- Tree

TreeNode* Tree::setRoot() {
    free(root);
    root = new TreeNode();
    return root;
}

bool Tree::isLeaf(TreeNode* node) const {
    return node != nullptr && node->left == nullptr && node->right == nullptr;
}

bool Tree::setData(TreeNode* node, fsToken const& token) {
    if (node == nullptr) {
        return false;
    }
    node->token = token;
    return true;
}

TreeNode* Tree::setLeftTreeNode(TreeNode* node) {
    if (node == nullptr) {
        return nullptr;
    }
    free(node->left);
    node->left = new TreeNode();
    return node->left;
}

TreeNode* Tree::setLeftTreeNode(TreeNode* node, fsToken const& token) {
    TreeNode* child = setLeftTreeNode(node);
    if (child != nullptr) {
        child->token = token;
    }
    return child;
}

TreeNode* Tree::setRightTreeNode(TreeNode* node) {
    if (node == nullptr) {
        return nullptr;
    }
    free(node->right);
    node->right = new TreeNode();
    return node->right;
}

TreeNode* Tree::setRightTreeNode(TreeNode* node, fsToken const& token) {
    TreeNode* child = setRightTreeNode(node);
    if (child != nullptr) {
        child->token = token;
    }
    return child;
}

TreeNode* Tree::createTreeNode() {
    return new TreeNode();
}

void Tree::merge(Tree* other) {
    TreeNode* top = new TreeNode();
    top->left = root;
    if (other != nullptr) {
        top->right = other->root;
        other->root = nullptr;
    }
    root = top;
}

bool Tree::preVisit(TreeNode* node) const {
    if (node == nullptr) {
        return false;
    }
    // Iterative: a chain of n operators makes a tree n deep.
    std::vector<TreeNode*> pending(1, node);
    while (!pending.empty()) {
        TreeNode* current = pending.back();
        pending.pop_back();
        if (current->left == nullptr && current->right == nullptr) {
            continue;
        }
        if (current->left == nullptr || current->right == nullptr) {
            return false;
        }
        pending.push_back(current->left);
        pending.push_back(current->right);
    }
    return true;
}

void Tree::free(TreeNode* node) {
    if (node == nullptr) {
        return;
    }
    if (node == root) {
        root = nullptr;
    }
    std::vector<TreeNode*> pending(1, node);
    while (!pending.empty()) {
        TreeNode* current = pending.back();
        pending.pop_back();
        if (current->left != nullptr) {
            pending.push_back(current->left);
        }
        if (current->right != nullptr) {
            pending.push_back(current->right);
        }
        delete current;
    }
}

// ---------------------------------------------------------------- SyntaxAnalyzer

namespace {

// Failure texts of the analyzers, by analyzer (see noteError).  Never
// destroyed: an analyzer of static storage may outlive it otherwise.
std::mutex errorTextsLock;

std::map<const SyntaxAnalyzer*, std::string>& errorTexts() {
    static auto* texts = new std::map<const SyntaxAnalyzer*, std::string>();
    return *texts;
}

}  // namespace

SyntaxAnalyzer::SyntaxAnalyzer()
    : lexer(new Lexer()),
      error(false),
      fields(nullptr),
      variables(nullptr),
      caseSensitive(true),
      orDepth(0),
      simple(true),
      tree(nullptr),
      trace(getQvLogFs()),
      hashOnly(false),
      nesting(0) {
    // The newest analyzer starts with no commands; its owner adds its own.
    cmdTokenTable().clear();
}

SyntaxAnalyzer::~SyntaxAnalyzer() {
    delete tree;
    delete lexer;
    std::lock_guard<std::mutex> guard(errorTextsLock);
    errorTexts().erase(this);
}

void SyntaxAnalyzer::noteError(std::string const& message) {
    std::string text = message;
    size_t head = text.find(" - ");
    if (head != std::string::npos && text.find("::") < head) {
        text.erase(0, head + 3);
    }
    while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
    std::lock_guard<std::mutex> guard(errorTextsLock);
    errorTexts()[this] = text;
}

std::string SyntaxAnalyzer::getErrorText() const {
    if (!error) return std::string();
    std::lock_guard<std::mutex> guard(errorTextsLock);
    std::map<const SyntaxAnalyzer*, std::string>::const_iterator found = errorTexts().find(this);
    return found != errorTexts().end() ? found->second : std::string();
}

bool SyntaxAnalyzer::parse(wchar_t const* text, Fields* fieldSource, Fields* variableSource,
                           ExpValue& result, bool caseFlag) {
    error = false;
    fields = fieldSource;
    variables = variableSource;
    caseSensitive = caseFlag;
    hashValue.clear();
    orDepth = 0;
    simple = true;
    nesting = 0;
    if (lexer == nullptr) {
        error = true;
        noteError("no lexer");
        return error;
    }
    lexer->setExpression(text);
    delete tree;
    tree = new Tree();
    tree->setRoot();

    bExpression(result, true, &tree);
    if (!error) {
        lexer->nextToken();
        if (lexer->getLastError() != Lexer::LEX_END) {
            FS_SA_FAIL("SyntaxAnalyzer::parse - expected operator.\n");
        }
    }
    return error;
}

bool SyntaxAnalyzer::parse(Fields* fieldSource, Fields* variableSource, ExpValue& result,
                           bool caseFlag) {
    error = false;
    fields = fieldSource;
    variables = variableSource;
    caseSensitive = caseFlag;
    if (tree == nullptr || tree->getRoot() == nullptr) {
        error = true;
        noteError("no parsed expression to evaluate");
        return error;
    }
    ExpValue value = evaluateExp(tree->getRoot());
    if (!error) {
        result = value;
    }
    return error;
}

namespace {

// Flags of a value computed from two operands: a field's if either was one,
// a constant if both were; the column name and any set are gone.
void deriveFlags(ExpValue& value, ExpValue const& left, ExpValue const& right) {
    int32_t fromField = (left.isField != 0 || right.isField != 0) ? 1 : 0;
    int32_t constant = (left.isConstant != 0 && right.isConstant != 0) ? 1 : 0;
    value.setNValueString(nullptr);
    value.lookup = nullptr;
    value.isField = fromField;
    value.isConstant = constant;
}

void setNumber(ExpValue& value, unsigned long long number) {
    value.setStringValue(nullptr);
    value.setNumericValue(number);
}

bool isToken(fsToken const& token, unsigned char type, unsigned long long number) {
    return token.type == type && token.numericValue == number;
}

// The operators of each binary level of the grammar.
bool isOrOperator(fsToken const& t) { return isToken(t, TOKEN_BOOLEAN, OP_LOGICAL_OR); }
bool isAndOperator(fsToken const& t) { return isToken(t, TOKEN_BOOLEAN, OP_LOGICAL_AND); }
bool isRelationalOperator(fsToken const& t) { return t.type == TOKEN_RELATIONAL; }
bool isAddingOperator(fsToken const& t) {
    return t.type == TOKEN_ARITHMETIC &&
           (t.numericValue == OP_PLUS || t.numericValue == OP_MINUS || t.numericValue == OP_OR);
}
bool isMultiplyingOperator(fsToken const& t) {
    return t.type == TOKEN_ARITHMETIC && (t.numericValue == OP_MULTIPLY ||
                                          t.numericValue == OP_DIVIDE || t.numericValue == OP_AND);
}

// The next token when it is one of the calling level's operators (accepts
// says which); any other token goes back to the lexer, and the level is done.
bool nextOperator(Lexer* lexer, fsToken& op, bool (*accepts)(fsToken const&)) {
    op = lexer->nextToken();
    if (accepts(op)) {
        return true;
    }
    lexer->back();
    return false;
}

// The right operand of one binary operator: its value, and the tree of its
// tokens, which attach hangs under the operator in the level's tree.  The
// operand's own tree goes with it, so a level that gives up just returns.
struct RightOperand {
    RightOperand() : tree(new Tree()) { tree->setRoot(); }
    ~RightOperand() { delete tree; }
    RightOperand(const RightOperand&) = delete;
    RightOperand& operator=(const RightOperand&) = delete;

    void attach(Tree** into, fsToken const& op) {
        (*into)->merge(tree);
        (*into)->setData((*into)->getRoot(), op);
    }

    Tree* tree;
    ExpValue value;
};

// Counts one factor on the recursion stack for as long as it lives.
class NestingGuard {
public:
    explicit NestingGuard(unsigned int& counter) : counter_(counter) { ++counter_; }
    ~NestingGuard() { --counter_; }
    NestingGuard(const NestingGuard&) = delete;
    NestingGuard& operator=(const NestingGuard&) = delete;

private:
    unsigned int& counter_;
};

}  // namespace

void SyntaxAnalyzer::bExpression(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    bool hadCandidate = hashValue.hasName();
    bTerm(value, evaluate, tree);
    if (error) {
        return;
    }
    fsToken op;
    while (nextOperator(lexer, op, isOrOperator)) {
        simple = false;
        ++orDepth;
        RightOperand right;
        // The right side is live only while the left is 0.
        bTerm(right.value, evaluate && value.number == 0, &right.tree);
        --orDepth;
        if (!hadCandidate) {
            // A candidate found inside a disjunction proves nothing.
            hashValue.clear();
        }
        if (error) {
            return;
        }
        if (!value.isNumeric() || !right.value.isNumeric()) {
            FS_SA_FAIL(
                "SyntaxAnalyzer::bExpression - bExpression operands of different types or not "
                "NUMERIC\n");
            return;
        }
        unsigned long long result = (value.number != 0 || right.value.number != 0) ? 1 : 0;
        deriveFlags(value, value, right.value);
        setNumber(value, result);
        right.attach(tree, op);
    }
}

void SyntaxAnalyzer::bTerm(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    relation(value, evaluate, tree);
    if (error) {
        return;
    }
    fsToken op;
    while (nextOperator(lexer, op, isAndOperator)) {
        // Once the chain is 0 the rest of it is dead.
        if (value.number == 0) {
            evaluate = false;
        }
        RightOperand right;
        relation(right.value, evaluate, &right.tree);
        simple = (orDepth == 0);
        if (error) {
            return;
        }
        if (!value.isNumeric() || !right.value.isNumeric()) {
            FS_SA_FAIL(
                "SyntaxAnalyzer::bTerm - bTerm operands of different types or not NUMERIC\n");
            return;
        }
        unsigned long long result = (value.number != 0 && right.value.number != 0) ? 1 : 0;
        deriveFlags(value, value, right.value);
        setNumber(value, result);
        right.attach(tree, op);
    }
}

void SyntaxAnalyzer::captureCandidate(ExpValue const& left, ExpValue const& right) {
    if (hashValue.hasName()) {
        return;
    }
    ExpValue const* column = nullptr;
    ExpValue const* literal = nullptr;
    if (left.isConstant != 0 && left.isField == 0 && right.isField != 0) {
        // literal == field: a wildcard in the literal plays no part.
        column = &right;
        literal = &left;
    } else if (left.isField == 1 && right.isConstant != 0 && right.isField == 0) {
        // field == literal: a set or a wildcard pattern can't be looked up.
        if (right.lookup != nullptr) {
            return;
        }
        if (right.isString() && checkWildCard(right.getStringValue())) {
            return;
        }
        column = &left;
        literal = &right;
    } else {
        return;
    }
    if (!column->hasName()) {
        return;
    }
    hashValue = *literal;
    hashValue.lookup = nullptr;
    hashValue.setNValueString(column->getNValueString());
}

void SyntaxAnalyzer::relation(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    expression(value, evaluate, tree);
    if (error) {
        return;
    }
    fsToken op;
    while (nextOperator(lexer, op, isRelationalOperator)) {
        RightOperand right;
        expression(right.value, evaluate, &right.tree);
        if (error) {
            return;
        }
        if (value.getType() != right.value.getType()) {
            FS_SA_FAIL("SyntaxAnalyzer::relation - relation operands of different types!\n");
            return;
        }
        unsigned int relop = static_cast<unsigned int>(op.numericValue);
        if (relop > OP_NOT_EQUAL) {
            FS_SA_FAIL("SyntaxAnalyzer::relation - OpRelXXX unknown!\n");
            return;
        }
        if (relop == OP_EQUAL) {
            captureCandidate(value, right.value);
        }
        bool holds = value.isString()
                         ? expCompareStrings(relop, value, right.value, caseSensitive)
                         : expCompareNumbers(relop, value.number, right.value.number);
        // The result counts as a field's if either side was one.
        int32_t fromField = (value.isField != 0 || right.value.isField != 0) ? 1 : 0;
        value.clear();
        value.setNumericValue(holds ? 1 : 0);
        value.isField = fromField;
        value.isConstant = fromField ? 0 : 1;
        right.attach(tree, op);
    }
}

void SyntaxAnalyzer::expression(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    term(value, evaluate, tree);
    if (error) {
        return;
    }
    fsToken op;
    while (nextOperator(lexer, op, isAddingOperator)) {
        unsigned long long number = op.numericValue;
        RightOperand right;
        term(right.value, evaluate, &right.tree);
        if (error) {
            return;
        }
        if (value.isString() && right.value.isString()) {
            if (number != OP_PLUS) {
                FS_SA_FAIL(
                    "SyntaxAnalyzer::expression - operator '%s' not permitted on string type\n",
                    number == OP_MINUS ? "-" : "|");
                return;
            }
            ExpValue joined;
            if (!expConcatenate(value, right.value, joined)) {
                FS_SA_FAIL(
                    "SyntaxAnalyzer::expression - string space not available for "
                    "concatenation\n");
                return;
            }
            deriveFlags(joined, value, right.value);
            value = joined;
        } else if (value.isNumeric() && right.value.isNumeric()) {
            unsigned long long result = 0;
            if (!expArithmetic(static_cast<unsigned int>(number), value.number,
                               right.value.number, &result)) {
                FS_SA_FAIL("SyntaxAnalyzer::expression - OpXXX unknown!\n");
                return;
            }
            deriveFlags(value, value, right.value);
            setNumber(value, result);
        } else {
            FS_SA_FAIL(
                "SyntaxAnalyzer::expression - expression operands of different types or not "
                "NUMERIC\n");
            return;
        }
        right.attach(tree, op);
    }
}

void SyntaxAnalyzer::term(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    factor(value, evaluate, tree);
    if (error) {
        return;
    }
    fsToken op;
    while (nextOperator(lexer, op, isMultiplyingOperator)) {
        unsigned long long number = op.numericValue;
        RightOperand right;
        factor(right.value, evaluate, &right.tree);
        if (error) {
            return;
        }
        if (!value.isNumeric() || !right.value.isNumeric()) {
            FS_SA_FAIL(
                "SyntaxAnalyzer::term - term operands of different types or not NUMERIC\n");
            return;
        }
        unsigned long long result = 0;
        if (!expArithmetic(static_cast<unsigned int>(number), value.number, right.value.number,
                           &result)) {
            if (number == OP_DIVIDE && right.value.number == 0) {
                if (evaluate) {
                    FS_SA_FAIL("SyntaxAnalyzer::term - division by zero!\n");
                    return;
                }
                // A dead operand's value is never used: it stays 0.
                result = 0;
            } else {
                FS_SA_FAIL("SyntaxAnalyzer::term - OpXXX unknown!\n");
                return;
            }
        }
        deriveFlags(value, value, right.value);
        setNumber(value, result);
        right.attach(tree, op);
    }
}

void SyntaxAnalyzer::factor(ExpValue& value, bool evaluate, Tree** tree) {
    if (error) {
        return;
    }
    if (nesting >= MAX_NESTING) {
        FS_SA_FAIL("SyntaxAnalyzer::factor - expression nested too deeply!\n");
        return;
    }
    NestingGuard guard(nesting);
    fsToken token = lexer->nextToken();
    switch (token.type) {
        case TOKEN_NUMBER:
        case TOKEN_STRING:
            if (!l_value(token, value)) {
                return;
            }
            (*tree)->setData((*tree)->getRoot(), token);
            return;
        case TOKEN_FIELD:
        case TOKEN_VARIABLE:
            if (findField(token) == nullptr) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - variable specified not found!\n");
                return;
            }
            if (!l_value(token, value)) {
                return;
            }
            (*tree)->setData((*tree)->getRoot(), token);
            return;
        case TOKEN_ARITHMETIC: {
            unsigned long long op = token.numericValue;
            if (op != OP_PLUS && op != OP_MINUS) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - expected '+' or '-'!\n");
                return;
            }
            factor(value, evaluate, tree);
            if (error) {
                return;
            }
            if (!value.isNumeric()) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - factor operand is not NUMERIC\n");
                return;
            }
            if (op == OP_MINUS) {
                value.number = 0ULL - value.number;
                // -[A] is no longer the column's value.
                value.setNValueString(nullptr);
            }
            Tree empty;
            empty.setRoot();
            (*tree)->merge(&empty);
            token.setNumericValue(op == OP_PLUS ? OP_UNARY_PLUS : OP_UNARY_MINUS);
            (*tree)->setData((*tree)->getRoot(), token);
            return;
        }
        case TOKEN_PARENTHESIS:
            if (token.numericValue != 0) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - unexpected sequence!\n");
                return;
            }
            bExpression(value, evaluate, tree);
            if (error) {
                return;
            }
            if (!isToken(lexer->nextToken(), TOKEN_PARENTHESIS, 1)) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - expected ')'\n");
            }
            return;
        case TOKEN_BOOLEAN: {
            if (token.numericValue != OP_NOT) {
                FS_SA_FAIL("SyntaxAnalyzer::factor - expected '!'\n");
                return;
            }
            bool hadCandidate = hashValue.hasName();
            factor(value, evaluate, tree);
            if (!hadCandidate) {
                // A candidate under a negation proves nothing.
                hashValue.clear();
            }
            if (error) {
                return;
            }
            if (!value.isNumeric()) {
                // The tree walk refuses a text under '!', so the first pass
                // does too.
                FS_SA_FAIL("SyntaxAnalyzer::factor - factor operand is not NUMERIC\n");
                return;
            }
            unsigned long long negated = value.number == 0 ? 1 : 0;
            value.setNValueString(nullptr);
            setNumber(value, negated);
            Tree empty;
            empty.setRoot();
            (*tree)->merge(&empty);
            (*tree)->setData((*tree)->getRoot(), token);
            return;
        }
        case TOKEN_COMMAND:
            break;
        default:
            FS_SA_FAIL("SyntaxAnalyzer::factor - unexpected sequence!\n");
            return;
    }

    // A command: its token at the root, its arguments as the children.
    std::vector<CmdToken>& table = cmdTokenTable();
    size_t index = static_cast<size_t>(token.numericValue);
    if (index >= table.size()) {
        FS_SA_FAIL("SyntaxAnalyzer::factor - command specified (%S) n_args not supported!\n",
                   token.getStringValue());
        return;
    }
    // A copy: a command may register others while it runs.
    CmdToken command = table[index];
    if (command.argumentCount != 1 && command.argumentCount != 2) {
        FS_SA_FAIL("SyntaxAnalyzer::factor - command specified (%S) n_args not supported!\n",
                   command.name);
        return;
    }
    if (!isToken(lexer->nextToken(), TOKEN_PARENTHESIS, 0)) {
        FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: '(' expected!\n", command.name);
        return;
    }
    ExpValue first;
    bExpression(first, evaluate, tree);
    if (error) {
        return;
    }
    if (first.getType() != command.argumentTypes[0]) {
        if (command.argumentCount == 2) {
            FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: first parameter type mismatch!\n",
                       command.name);
        } else {
            FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: parameter type mismatch!\n",
                       command.name);
        }
        return;
    }
    Tree* secondTree = new Tree();
    secondTree->setRoot();
    ExpValue second;
    if (command.argumentCount == 2) {
        if (!isToken(lexer->nextToken(), TOKEN_SIGN, 1)) {
            delete secondTree;
            FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: ',' expected!\n", command.name);
            return;
        }
        bExpression(second, evaluate, &secondTree);
        if (error) {
            delete secondTree;
            return;
        }
        if (second.getType() != command.argumentTypes[1]) {
            delete secondTree;
            FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: second parameter type mismatch!\n",
                       command.name);
            return;
        }
    }
    if (!isToken(lexer->nextToken(), TOKEN_PARENTHESIS, 1)) {
        delete secondTree;
        FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: ')' expected!\n", command.name);
        return;
    }
    if (trace != nullptr) {
        trace->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                        "SyntaxAnalyzer::factor - executing command[%S]...\n", command.name);
    }
    if (hashOnly) {
        if (trace != nullptr) {
            trace->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                            "SyntaxAnalyzer::factor - command[%S]: resetting factorValue [%d]!\n",
                            command.name, static_cast<int>(command.returnType));
        }
        resetExpValue(command.returnType, value);
    } else if (!evaluate) {
        // A dead operand: its value is never used, so the command isn't run.
        resetExpValue(command.returnType, value);
    } else {
        ExpValue produced;
        int rc = command.argumentCount == 1 ? command.command.unary->execute(first, produced)
                                            : command.command.binary->execute(first, second,
                                                                              produced);
        if (rc != 0) {
            delete secondTree;
            FS_SA_FAIL("SyntaxAnalyzer::factor - command[%S]: execute failed!\n", command.name);
            return;
        }
        value = produced;
    }
    value.isConstant = 0;
    value.isField = 0;
    value.lookup = nullptr;
    (*tree)->merge(secondTree);
    (*tree)->setData((*tree)->getRoot(), token);
    delete secondTree;
}
