#include "fscanner/fscommon/criteria.h"

#include <cwchar>

#include "base/kelmem.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/syntaxanalyzer.h"

// ---------------------------------------------------------------- NameMaskFilter

namespace {

// Deeper trees (long chains of || or &&) are not followed: the recursion of
// the filter stays small, and such a part counts as possibly true.
const unsigned int FILTER_MAX_DEPTH = 64;

bool isLeaf(TreeNode const* node) { return node != nullptr && node->left == nullptr && node->right == nullptr; }

}  // namespace

NameMaskFilter::NameMaskFilter(TreeNode* top, Fields* fields) : fold(FoldedByteCase::fromLocale()) {
    if (top == nullptr || fields == nullptr) return;
    root = add(top, fields, 0);
    bool anyMask = false;
    for (Node const& n : nodes) anyMask = anyMask || n.kind == MASK;
    if (!anyMask || column < 0) {
        column = -1;
        nodes.clear();
        root = -1;
    }
}

namespace {

// A leaf whose value the walk reads without any chance of failing: a number,
// or an integer column the fields hold.
bool quietNumberLeaf(TreeNode const* node, Fields* fields) {
    if (!isLeaf(node)) return false;
    fsToken const& token = node->token;
    if (token.type == TOKEN_NUMBER) return true;
    if (token.type != TOKEN_FIELD) return false;
    Field* field = fields->name(token.getStringValue());
    return field != nullptr && field->getType() >= FIELD_INT8 && field->getType() <= FIELD_INT64;
}

}  // namespace

int NameMaskFilter::add(TreeNode* node, Fields* fields, unsigned int depth) {
    Node made;
    made.kind = OTHER;
    made.left = -1;
    made.right = -1;
    made.suffixOnly = false;
    if (node != nullptr && depth < FILTER_MAX_DEPTH) {
        fsToken const& token = node->token;
        if (token.type == TOKEN_BOOLEAN &&
            (token.numericValue == OP_LOGICAL_AND || token.numericValue == OP_LOGICAL_OR) &&
            node->left != nullptr && node->right != nullptr) {
            int left = add(node->left, fields, depth + 1);
            int right = add(node->right, fields, depth + 1);
            made.kind = token.numericValue == OP_LOGICAL_AND ? AND : OR;
            made.left = left;
            made.right = right;
        } else if (token.type == TOKEN_RELATIONAL && token.numericValue == OP_EQUAL &&
                   isLeaf(node->left) && isLeaf(node->right) && node->left->token.type == TOKEN_FIELD &&
                   node->right->token.type == TOKEN_STRING && node->right->token.lookup == nullptr) {
            // A stored name is at most 0xFFFF bytes, far below the text limit
            // of a value, so reading the column never fails.
            wchar_t const* name = node->left->token.getStringValue();
            wchar_t const* mask = node->right->token.getStringValue();
            Field* field = fields->name(name);
            int position = -1;
            for (unsigned int i = 0; field != nullptr && i < fields->count() && position < 0; ++i)
                if (fields->at(i) == field) position = static_cast<int>(i);
            std::string bytes;
            bool ascii = mask != nullptr;
            for (size_t i = 0; ascii && mask[i] != 0; ++i) {
                if (mask[i] < 1 || mask[i] > 127) ascii = false;
                else bytes.push_back(static_cast<char>(mask[i]));
            }
            if (field != nullptr && field->getType() == FIELD_TEXT && ascii &&
                (column < 0 || column == position)) {
                column = position;
                made.kind = MASK;
                made.mask = bytes;
                made.suffixOnly = bytes.size() >= 1 && bytes[0] == '*' &&
                                  bytes.find_first_of("*?", 1) == std::string::npos;
            }
        } else if (quietNumberLeaf(node, fields)) {
            made.kind = PURE;
        } else if (token.type == TOKEN_RELATIONAL && token.numericValue <= OP_NOT_EQUAL &&
                   quietNumberLeaf(node->left, fields) && quietNumberLeaf(node->right, fields)) {
            made.kind = PURE;
        }
    }
    nodes.push_back(made);
    return static_cast<int>(nodes.size() - 1);
}

NameMaskFilter::Outcome NameMaskFilter::evaluate(int index, const unsigned char* text, size_t length,
                                                 bool caseSensitive) const {
    if (index < 0) return ANY;
    Node const& n = nodes[static_cast<size_t>(index)];
    switch (n.kind) {
        case AND: {
            // The walk gives && and || the values 0 and 1 (or fails), and
            // takes the left side first: a quiet 0 there ends the walk of the
            // node; after a quiet left side a quiet 0 on the right makes 0.
            Outcome left = evaluate(n.left, text, length, caseSensitive);
            if (left != QUIET) return left;
            Outcome right = evaluate(n.right, text, length, caseSensitive);
            return right;
        }
        case OR: {
            Outcome left = evaluate(n.left, text, length, caseSensitive);
            if (left == ANY) return ANY;
            Outcome right = evaluate(n.right, text, length, caseSensitive);
            if (right == ANY) return ANY;
            return (left == FALSE_QUIET && right == FALSE_QUIET) ? FALSE_QUIET : QUIET;
        }
        case MASK:
            if (n.suffixOnly) return endsWithTail(n, text, length, caseSensitive) ? QUIET : FALSE_QUIET;
            // A plain mask is compared whole by the evaluator; the glob of a
            // mask without "*" and "?" is that same comparison.
            return asciiWildvccmp(reinterpret_cast<const unsigned char*>(n.mask.c_str()), text, length,
                                  caseSensitive, fold)
                       ? QUIET
                       : FALSE_QUIET;
        case PURE:
            return QUIET;
        default:
            return ANY;
    }
}

bool NameMaskFilter::mayMatch(const unsigned char* text, size_t length, bool caseSensitive) const {
    if (text == nullptr || !isPlainAscii(text, length)) return true;
    return mayMatchAscii(text, length, caseSensitive);
}

// ---------------------------------------------------------------- CriteriaEvaluator

CriteriaEvaluator::CriteriaEvaluator(wchar_t const* text)
    : analyzer(nullptr),
      criteria(nullptr),
      valid(false),
      firstCheck(true),
      failed(false),
      hashInfo(nullptr),
      fields(nullptr),
      variables(nullptr) {
    if (text == nullptr) {
        return;
    }
    size_t length = wcslen(text);
    criteria = static_cast<wchar_t*>(kelm_malloc((length + 1) * sizeof(wchar_t)));
    if (criteria == nullptr) {
        return;
    }
    wmemcpy(criteria, text, length + 1);
    analyzer = new SyntaxAnalyzer();
    valid = true;
}

CriteriaEvaluator::~CriteriaEvaluator() {
    delete nameFilter;
    delete analyzer;
    kelm_free(criteria);
    delete hashInfo;
}

bool CriteriaEvaluator::setFields(Fields* source) {
    if (!valid || source == nullptr) {
        return false;
    }
    fields = source;
    return true;
}

bool CriteriaEvaluator::setVariables(Fields* source) {
    if (!valid || source == nullptr) {
        return false;
    }
    variables = source;
    return true;
}

int CriteriaEvaluator::check(Fields* fieldSource, Fields* variableSource, bool caseSensitive) {
    if (!valid) {
        return -1;
    }
    Fields* useFields = fieldSource != nullptr ? fieldSource : fields;
    Fields* useVariables = variableSource != nullptr ? variableSource : variables;
    if (firstCheck) {
        firstCheck = false;
        failed = analyzer->parse(criteria, useFields, useVariables, result, caseSensitive);
    } else {
        failed = analyzer->parse(useFields, useVariables, result, caseSensitive);
    }
    if (failed) {
        return -1;
    }
    return static_cast<int>(static_cast<uint32_t>(result.number));
}

int CriteriaEvaluator::check(bool caseSensitive) {
    return check(nullptr, nullptr, caseSensitive);
}

bool CriteriaEvaluator::addCmd(wchar_t const* name, char returnType, char argumentType,
                               UnaryCmd* command) {
    if (analyzer == nullptr) {
        return false;
    }
    return analyzer->addCmdToken(name, returnType, argumentType, command);
}

bool CriteriaEvaluator::addCmd(wchar_t const* name, char returnType, char firstType,
                               char secondType, BinaryCmd* command) {
    if (analyzer == nullptr) {
        return false;
    }
    return analyzer->addCmdToken(name, returnType, firstType, secondType, command);
}

bool CriteriaEvaluator::findCmd(wchar_t const* name, char argumentType) {
    if (analyzer == nullptr) {
        return false;
    }
    return analyzer->findCmdToken(name, argumentType);
}

bool CriteriaEvaluator::findCmd(wchar_t const* name, char firstType, char secondType) {
    if (analyzer == nullptr) {
        return false;
    }
    return analyzer->findCmdToken(name, firstType, secondType);
}

ExpValue* CriteriaEvaluator::getHashInfo() {
    if (!valid) {
        return nullptr;
    }
    if (hashInfo != nullptr) {
        return hashInfo;
    }
    if (fields == nullptr) {
        return nullptr;
    }
    hashInfo = new ExpValue();
    if (firstCheck) {
        // Parse without running commands; the tree stands for later checks.
        ExpValue scratch;
        analyzer->setHashOnly(true);
        failed = analyzer->parse(criteria, fields, variables, scratch, true);
        analyzer->setHashOnly(false);
        firstCheck = false;
    }
    if (analyzer->getHashValue(*hashInfo)) {
        return hashInfo;
    }
    return nullptr;
}

bool CriteriaEvaluator::setHashInfo(ExpValue& value) {
    if (!valid) {
        return false;
    }
    if (hashInfo == nullptr) {
        hashInfo = new ExpValue();
    }
    *hashInfo = value;
    return true;
}

// ---------------------------------------------------------------- Evaluator

Evaluator::Evaluator() : index(0), current(L'\0'), text(nullptr), errorFlag(false), depth(0) {}

void Evaluator::advance() {
    if (current != L'\0') {
        ++index;
        current = text[index];
    }
}

bool Evaluator::execute(wchar_t const* expression) {
    text = expression;
    index = 0;
    depth = 0;
    errorFlag = false;
    if (text == nullptr) {
        current = L'\0';
        errorFlag = true;
        return false;
    }
    current = text[0];
    bool value = orExp();
    if (!errorFlag && current != L'\0') {
        errorFlag = true;
    }
    return errorFlag ? false : value;
}

bool Evaluator::orExp() {
    if (errorFlag) {
        return false;
    }
    bool value = andExp();
    while (!errorFlag && current == L'|') {
        advance();
        bool right = andExp();
        value = value || right;
    }
    return errorFlag ? false : value;
}

bool Evaluator::andExp() {
    if (errorFlag) {
        return false;
    }
    bool value = simpExp();
    while (!errorFlag && current == L'&') {
        advance();
        bool right = simpExp();
        value = value && right;
    }
    return errorFlag ? false : value;
}

bool Evaluator::simpExp() {
    if (errorFlag) {
        return false;
    }
    if ((current == L'(' || current == L'!') && depth >= MAX_DEPTH) {
        errorFlag = true;
        return false;
    }
    switch (current) {
        case L'(': {
            advance();
            ++depth;
            bool value = orExp();
            --depth;
            if (errorFlag) {
                return false;
            }
            if (current != L')') {
                errorFlag = true;
                return false;
            }
            advance();
            return value;
        }
        case L'!': {
            advance();
            ++depth;
            bool value = orExp();
            --depth;
            return errorFlag ? false : !value;
        }
        case L'0':
            advance();
            return false;
        case L'1':
            advance();
            return true;
        default:
            errorFlag = true;
            return false;
    }
}

NameMaskFilter const* CriteriaEvaluator::getNameFilter(Fields* source) {
    if (!valid || analyzer == nullptr || source == nullptr) {
        return nullptr;
    }
    if (!nameFilterBuilt) {
        // Only a tree that parsed whole stands for the expression; and the
        // filter must be built for the very fields it is used with.
        nameFilterBuilt = true;
        if (!firstCheck && !failed && analyzer->getTree() != nullptr) {
            nameFilter = new NameMaskFilter(analyzer->getTree()->getRoot(), source);
            filterFields = source;
        }
    }
    if (nameFilter == nullptr || !nameFilter->usable() || filterFields != source) {
        return nullptr;
    }
    return nameFilter;
}
