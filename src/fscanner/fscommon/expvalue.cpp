#include "fscanner/fscommon/expvalue.h"

#include <cwchar>

#include <algorithm>
#include <climits>
#include <memory>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "fscanner/fscommon/syntaxfail.h"
#include "fscanner/fscommon/wildcard.h"

ExpValue::ExpValue()
    : value(valueBuffer),
      nValue(nValueBuffer),
      type(EXP_NUMERIC),
      isConstant(0),
      isField(0),
      number(0),
      lookup(nullptr) {
    valueBuffer[0] = L'\0';
    nValueBuffer[0] = L'\0';
}

ExpValue::ExpValue(const ExpValue& other) : ExpValue() {
    *this = other;
}

ExpValue& ExpValue::operator=(const ExpValue& other) {
    if (this == &other) {
        return *this;
    }
    setStringValue(other.value, other.getStringLength());
    setNValueString(other.nValue);
    type = other.type;
    isConstant = other.isConstant;
    isField = other.isField;
    number = other.number;
    lookup = other.lookup;
    return *this;
}

ExpValue::~ExpValue() {
    release(valueBuffer, &value);
    release(nValueBuffer, &nValue);
}

void ExpValue::release(wchar_t* inlineBuffer, wchar_t** current) {
    if (*current != inlineBuffer) {
        kelm_free(*current);
    }
    *current = inlineBuffer;
    inlineBuffer[0] = L'\0';
}

bool ExpValue::assign(wchar_t* inlineBuffer, wchar_t** current, wchar_t const* text,
                      size_t length) {
    if (text == *current) {
        // Assigning a value's own text to itself: nothing to do.
        return true;
    }
    release(inlineBuffer, current);
    if (text == nullptr) {
        return true;
    }
    wchar_t* target = inlineBuffer;
    if (length >= INLINE_CHARS) {
        target = static_cast<wchar_t*>(kelm_malloc((length + 1) * sizeof(wchar_t)));
        if (target == nullptr) {
            return false;
        }
    }
    wmemcpy(target, text, length);
    target[length] = L'\0';
    *current = target;
    return true;
}

bool ExpValue::setStringValue(wchar_t const* text) {
    return assign(valueBuffer, &value, text, text != nullptr ? wcslen(text) : 0);
}

bool ExpValue::setStringValue(wchar_t const* text, size_t length) {
    return assign(valueBuffer, &value, text, length);
}

size_t ExpValue::getStringLength() const {
    return wcslen(value);
}

bool ExpValue::setNValueString(wchar_t const* text) {
    return assign(nValueBuffer, &nValue, text, text != nullptr ? wcslen(text) : 0);
}

void ExpValue::clear() {
    release(valueBuffer, &value);
    release(nValueBuffer, &nValue);
    type = EXP_NUMERIC;
    isConstant = 0;
    isField = 0;
    number = 0;
    lookup = nullptr;
}

std::vector<CmdToken>& cmdTokenTable() {
    static std::vector<CmdToken> table;
    return table;
}

bool resetExpValue(char type, ExpValue& value) {
    if (type != EXP_NUMERIC && type != EXP_STRING) {
        return false;
    }
    value.clear();
    value.setType(type);
    return true;
}

namespace {

// value relop other for relop 0..5 (== >= <= > < !=); false for any other.
template <typename T>
bool compareValues(T value, unsigned int relop, T other) {
    switch (relop) {
        case 0:
            return value == other;
        case 1:
            return value >= other;
        case 2:
            return value <= other;
        case 3:
            return value > other;
        case 4:
            return value < other;
        case 5:
            return value != other;
        default:
            return false;
    }
}

}  // namespace

bool checkSimpleExpression(unsigned char value, unsigned int relop, unsigned char other) {
    return compareValues(value, relop, other);
}

bool checkSimpleExpression(unsigned short value, unsigned int relop, unsigned short other) {
    return compareValues(value, relop, other);
}

bool checkSimpleExpression(unsigned int value, unsigned int relop, unsigned int other) {
    return compareValues(value, relop, other);
}

bool checkSimpleExpression(unsigned long long value, unsigned int relop,
                           unsigned long long other) {
    return compareValues(value, relop, other);
}

bool checkSimpleExpression(unsigned long value, unsigned int relop, unsigned long other) {
    return compareValues(value, relop, other);
}

bool checkSimpleExpression(wchar_t const* value, unsigned int relop, wchar_t const* other,
                           bool caseSensitive) {
    if (value == nullptr || other == nullptr) {
        return false;
    }
    switch (relop) {
        case 0:
            return wildvccmp(other, value, caseSensitive);
        case 5:
            return !wildvccmp(other, value, caseSensitive);
        default:
            // The orders (1..4) compare the texts; any other relop holds never.
            return relop < 5 && compareValues(wcsvccmp(value, other, caseSensitive), relop, 0);
    }
}

// ---------------------------------------------------------------- operators

bool expArithmetic(unsigned int op, unsigned long long left, unsigned long long right,
                   unsigned long long* result) {
    switch (op) {
        case 0:
            *result = left + right;
            return true;
        case 2:
            *result = left - right;
            return true;
        case 4:
            *result = left * right;
            return true;
        case 5: {
            long long l = static_cast<long long>(left);
            long long r = static_cast<long long>(right);
            if (r == 0) {
                return false;
            }
            if (l == LLONG_MIN && r == -1) {
                // The quotient does not fit; two's complement wraps it to itself.
                *result = left;
                return true;
            }
            *result = static_cast<unsigned long long>(l / r);
            return true;
        }
        case 6:
            *result = left & right;
            return true;
        case 7:
            *result = left | right;
            return true;
        default:
            return false;
    }
}

bool expCompareNumbers(unsigned int relop, unsigned long long left, unsigned long long right) {
    // Numbers of the language compare signed.
    return compareValues(static_cast<long long>(left), relop, static_cast<long long>(right));
}

namespace {

bool stringsEqual(ExpValue const& left, ExpValue const& right, bool caseSensitive) {
    if (right.lookup != nullptr) {
        return right.lookup->find(left.getStringValue());
    }
    if (checkWildCard(right.getStringValue())) {
        return wildvccmp(right.getStringValue(), left.getStringValue(), caseSensitive);
    }
    return wcsvccmp(right.getStringValue(), left.getStringValue(), caseSensitive) == 0;
}

}  // namespace

bool expCompareStrings(unsigned int relop, ExpValue const& left, ExpValue const& right,
                       bool caseSensitive) {
    switch (relop) {
        case 0:
            return stringsEqual(left, right, caseSensitive);
        case 5:
            return !stringsEqual(left, right, caseSensitive);
        default:
            // The orders (1..4) compare the texts; any other relop holds never.
            return relop < 5 && compareValues(wcsvccmp(left.getStringValue(),
                                                       right.getStringValue(), caseSensitive),
                                              relop, 0);
    }
}

bool expConcatenate(ExpValue const& left, ExpValue const& right, ExpValue& result) {
    size_t leftLength = left.getStringLength();
    size_t rightLength = right.getStringLength();
    size_t total = leftLength + rightLength;
    if (total + 1 > EXP_MAX_STRING) {
        return false;
    }
    wchar_t* joined = static_cast<wchar_t*>(kelm_malloc((total + 1) * sizeof(wchar_t)));
    if (joined == nullptr) {
        return false;
    }
    wmemcpy(joined, left.getStringValue(), leftLength);
    wmemcpy(joined + leftLength, right.getStringValue(), rightLength);
    joined[total] = L'\0';
    bool stored = result.setStringValue(joined, total);
    kelm_free(joined);
    result.setType(EXP_STRING);
    return stored;
}

// ---------------------------------------------------------------- commands

namespace {

bool validCommandName(wchar_t const* name) {
    return name != nullptr && name[0] != L'\0' && wcslen(name) <= CmdToken::MAX_NAME;
}

bool validType(char type) {
    return type == EXP_NUMERIC || type == EXP_STRING;
}

bool sameSignature(CmdToken const& entry, wchar_t const* name, std::vector<char> const& types) {
    return wcscmp(entry.name, name) == 0 && entry.argumentTypes == types;
}

// Enters command (entry holds the pointer) under name with these argument
// types into the process-wide table; false when that signature is there.
bool addCommand(wchar_t const* name, char returnType, std::vector<char> const& types,
                CmdToken& entry) {
    std::vector<CmdToken>& table = cmdTokenTable();
    for (CmdToken const& known : table) {
        if (sameSignature(known, name, types)) {
            return false;
        }
    }
    wcscpy(entry.name, name);
    entry.argumentCount = static_cast<unsigned char>(types.size());
    entry.returnType = returnType;
    entry.argumentTypes = types;
    table.push_back(entry);
    return true;
}

// True when the table has a command of this name whose argument types begin
// with types.
bool hasCommand(wchar_t const* name, std::vector<char> const& types) {
    if (name == nullptr) {
        return false;
    }
    for (CmdToken const& entry : cmdTokenTable()) {
        if (wcscmp(entry.name, name) == 0 && entry.argumentTypes.size() >= types.size() &&
            std::equal(types.begin(), types.end(), entry.argumentTypes.begin())) {
            return true;
        }
    }
    return false;
}

}  // namespace

bool SyntaxAnalyzer::addCmdToken(wchar_t const* name, char returnType, char argumentType,
                                 UnaryCmd* command) {
    if (!validCommandName(name) || command == nullptr || !validType(returnType) ||
        !validType(argumentType)) {
        return false;
    }
    CmdToken entry;
    entry.command.unary = command;
    return addCommand(name, returnType, std::vector<char>{argumentType}, entry);
}

bool SyntaxAnalyzer::addCmdToken(wchar_t const* name, char returnType, char firstType,
                                 char secondType, BinaryCmd* command) {
    if (!validCommandName(name) || command == nullptr || !validType(returnType) ||
        !validType(firstType) || !validType(secondType)) {
        return false;
    }
    std::vector<char> types;
    types.push_back(firstType);
    types.push_back(secondType);
    CmdToken entry;
    entry.command.binary = command;
    return addCommand(name, returnType, types, entry);
}

bool SyntaxAnalyzer::findCmdToken(wchar_t const* name, char argumentType) {
    return hasCommand(name, std::vector<char>{argumentType});
}

bool SyntaxAnalyzer::findCmdToken(wchar_t const* name, char firstType, char secondType) {
    return hasCommand(name, std::vector<char>{firstType, secondType});
}

// ---------------------------------------------------------------- leaves

Field* SyntaxAnalyzer::findField(fsToken const& token) {
    Fields* source = token.type == TOKEN_FIELD ? fields : variables;
    if (source == nullptr) {
        return nullptr;
    }
    return source->name(token.getStringValue());
}

bool SyntaxAnalyzer::l_value(fsToken& token, ExpValue& value) {
    switch (token.type) {
        case TOKEN_STRING:
            value.clear();
            if (!value.setString(token.getStringValue())) {
                return FS_SA_FAIL("SyntaxTree::l_value - string space not available\n");
            }
            value.lookup = token.lookup;
            value.isConstant = 1;
            return true;
        case TOKEN_NUMBER:
            value.clear();
            value.setNumericValue(token.numericValue);
            value.isConstant = 1;
            return true;
        case TOKEN_FIELD:
        case TOKEN_VARIABLE:
            break;
        default:
            // Empty leaves (the right side of a unary node) leave the value alone.
            return true;
    }
    Field* field = findField(token);
    if (field == nullptr) {
        return FS_SA_FAIL("SyntaxTree::l_value - variable specified not found!\n");
    }
    value.clear();
    switch (field->getType()) {
        case FIELD_INT8:
            value.setNumericValue(static_cast<Int8Field*>(field)->value());
            break;
        case FIELD_INT16:
            value.setNumericValue(static_cast<Int16Field*>(field)->value());
            break;
        case FIELD_INT32:
            value.setNumericValue(static_cast<Int32Field*>(field)->value());
            break;
        case FIELD_INT64:
            value.setNumericValue(static_cast<Int64Field*>(field)->value());
            break;
        case FIELD_TEXT: {
            wchar_t const* text = static_cast<TextField*>(field)->value();
            size_t length = text != nullptr ? wcslen(text) : 0;
            if (length >= EXP_MAX_STRING + 1 || !value.setString(text)) {
                value.clear();
                return FS_SA_FAIL("SyntaxTree::l_value - string space not available\n");
            }
            break;
        }
        default:
            return FS_SA_FAIL("SyntaxTree::l_value - field type %u not supported\n", field->getType());
    }
    value.setNValueString(field->getName());
    value.isConstant = 0;
    value.isField = 1;
    return true;
}

// ---------------------------------------------------------------- resolve

bool SyntaxAnalyzer::runCommand(fsToken& token, ExpValue& first, ExpValue& second,
                                ExpValue& result) {
    std::vector<CmdToken>& table = cmdTokenTable();
    size_t index = static_cast<size_t>(token.numericValue);
    if (index >= table.size() ||
        (table[index].argumentCount != 1 && table[index].argumentCount != 2)) {
        // The table was emptied by a newer analyzer, or holds a shape no
        // command can have.
        return FS_SA_FAIL("SyntaxTree::resolve - command[%S] not supported\n",
                    token.getStringValue());
    }
    // A copy: a command may change the table while it runs.
    CmdToken entry = table[index];
    if (first.getType() != entry.argumentTypes[0] ||
        (entry.argumentCount == 2 && second.getType() != entry.argumentTypes[1])) {
        return FS_SA_FAIL("SyntaxTree::resolve - command[%S], arguments type mismatch\n", entry.name);
    }
    ExpValue produced;
    int rc = entry.argumentCount == 1 ? entry.command.unary->execute(first, produced)
                                      : entry.command.binary->execute(first, second, produced);
    if (rc != 0) {
        return FS_SA_FAIL("SyntaxAnalyzer::resolve - command[%S]: execute failed!\n", entry.name);
    }
    result = produced;
    return true;
}

bool SyntaxAnalyzer::resolve(fsToken& operatorToken, ExpValue& left, ExpValue& right,
                             ExpValue& result) {
    unsigned int op = static_cast<unsigned int>(operatorToken.numericValue);
    switch (operatorToken.type) {
        case TOKEN_BOOLEAN:
            if (op == OP_NOT) {
                if (!left.isNumeric()) {
                    return FS_SA_FAIL("SyntaxTree::resolve - operand of '!' not NUMERIC\n");
                }
                result.clear();
                result.setNumericValue(left.number == 0 ? 1 : 0);
                return true;
            }
            if (!left.isNumeric() || !right.isNumeric()) {
                return FS_SA_FAIL("SyntaxTree::resolve - boolean operands not NUMERIC\n");
            }
            result.clear();
            if (op == OP_LOGICAL_AND) {
                result.setNumericValue(left.number != 0 && right.number != 0 ? 1 : 0);
            } else {
                result.setNumericValue(left.number != 0 || right.number != 0 ? 1 : 0);
            }
            return true;
        case TOKEN_ARITHMETIC:
            if (op == OP_UNARY_PLUS || op == OP_UNARY_MINUS) {
                if (!left.isNumeric()) {
                    return FS_SA_FAIL("SyntaxTree::resolve - unary operand not NUMERIC\n");
                }
                result = left;
                result.setNValueString(nullptr);
                if (op == OP_UNARY_MINUS) {
                    result.number = 0ULL - left.number;
                }
                return true;
            }
            if (left.isString() && right.isString()) {
                if (op != OP_PLUS) {
                    // Other operators on texts leave the result alone.
                    return true;
                }
                ExpValue joined;
                if (!expConcatenate(left, right, joined)) {
                    return FS_SA_FAIL("SyntaxTree::resolve - string space not available for "
                                "concatenation\n");
                }
                result = joined;
                return true;
            }
            if (left.isNumeric() && right.isNumeric()) {
                unsigned long long number = 0;
                if (!expArithmetic(op, left.number, right.number, &number)) {
                    if (op == OP_DIVIDE) {
                        return FS_SA_FAIL("SyntaxTree::resolve - division by zero\n");
                    }
                    return true;
                }
                result.clear();
                result.setNumericValue(number);
            }
            return true;
        case TOKEN_RELATIONAL:
            if (left.isString() && right.isString()) {
                result.clear();
                result.setNumericValue(expCompareStrings(op, left, right, caseSensitive) ? 1 : 0);
            } else if (left.isNumeric() && right.isNumeric()) {
                result.clear();
                result.setNumericValue(expCompareNumbers(op, left.number, right.number) ? 1 : 0);
            }
            return true;
        case TOKEN_COMMAND:
            return runCommand(operatorToken, left, right, result);
        default:
            return true;
    }
}

// ---------------------------------------------------------------- tree walk

ExpValue SyntaxAnalyzer::evaluateExp(TreeNode* node) {
    ExpValue returned;
    // The frames of the walk are kept between walks, so that checking a row
    // allocates nothing once the deepest tree has been walked.  A command
    // that walks this same analyzer again from inside gets frames of its own.
    std::vector<WalkFrame> ownFrames;
    std::vector<WalkFrame>& frames = walking ? ownFrames : walkFrames;
    bool outermost = !walking;
    walking = true;
    size_t depth = 0;

    // Starts a node: either its value is known at once (in `returned`), or a
    // frame is pushed and the loop goes on with it.
    auto enter = [&](TreeNode* n) -> bool {
        returned.clear();
        if (n == nullptr || error) {
            return true;
        }
        if (n->left == nullptr && n->right == nullptr) {
            l_value(n->token, returned);
            return true;
        }
        if (depth == frames.size()) {
            frames.emplace_back();
        }
        WalkFrame& pushed = frames[depth++];
        pushed.node = n;
        pushed.stage = 0;
        pushed.cachedSet = false;
        return false;
    };

    if (!enter(node)) {
        while (depth != 0) {
            // Taken again at every turn: a push may move the frames.
            WalkFrame& frame = frames[depth - 1];
            fsToken& token = frame.node->token;
            if (frame.stage == 0) {
                frame.stage = 1;
                if (!enter(frame.node->left)) {
                    continue;
                }
            }
            if (frame.stage == 1) {
                frame.left = returned;
                if (error) {
                    returned.clear();
                    --depth;
                    continue;
                }
                if (token.type == TOKEN_BOOLEAN) {
                    unsigned long long op = token.numericValue;
                    // || short-circuits on exactly 1 only; another true value
                    // evaluates the right side too.
                    if ((op == OP_LOGICAL_AND && frame.left.number == 0) ||
                        (op == OP_LOGICAL_OR && frame.left.number == 1)) {
                        returned.clear();
                        returned.setNumericValue(op == OP_LOGICAL_AND ? 0 : 1);
                        --depth;
                        continue;
                    }
                }
                frame.stage = 2;
                TreeNode* right = frame.node->right;
                if (right != nullptr && right->token.lookup != nullptr) {
                    frame.cachedSet = true;
                    if (right->token.value.lookup != nullptr) {
                        // The set operand was computed before: reuse it.
                        returned = right->token.value;
                    } else if (!enter(right)) {
                        continue;
                    }
                } else if (!enter(right)) {
                    continue;
                }
            }
            // stage 2: the right operand is in `returned`.
            WalkFrame& current = frames[depth - 1];
            ExpValue rightValue;
            if (current.cachedSet) {
                TreeNode* right = current.node->right;
                if (right->token.value.lookup == nullptr && !error) {
                    right->token.value = returned;
                }
                rightValue = right->token.value;
            } else {
                rightValue = returned;
            }
            ExpValue result;
            if (!error) {
                resolve(current.node->token, current.left, rightValue, result);
            }
            --depth;
            if (error) {
                returned.clear();
            } else {
                returned = result;
            }
        }
    }
    if (outermost) {
        walking = false;
    }
    return returned;
}

bool SyntaxAnalyzer::getHashValue(ExpValue& out) {
    if (!simple || !hashValue.hasName()) {
        return false;
    }
    out = hashValue;
    return true;
}
