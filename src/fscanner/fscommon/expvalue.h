// Values of the query language, the commands a host adds to it, and the
// simple comparisons the rest of the library shares.
//
// ExpValue is a deep-copying value: a number or a wide text, plus the name of
// the column the value came from.  Texts of up to 127 characters live in the
// object; longer ones in a kelm_malloc block that the value owns.
//
// The command table is one std::vector<CmdToken> for the whole process.  A
// command token's number is its index in the table.  Constructing a
// SyntaxAnalyzer empties the table, so only the newest analyzer's owner has
// working commands.  Nothing here is locked: one thread registers and parses.
#ifndef FSCANNER_FSCOMMON_EXPVALUE_H
#define FSCANNER_FSCOMMON_EXPVALUE_H

#include <cstddef>
#include <cstdint>
#include <vector>

class FileMaskLookup;

// Value type codes, also used as command argument and return types.
const char EXP_NUMERIC = 0;
const char EXP_STRING = 1;

// Longest text a value may hold, in characters; a concatenation or a field
// text that would reach it is refused.
const unsigned int EXP_MAX_STRING = 4194303;

class ExpValue {
public:
    // Texts of up to INLINE_CHARS - 1 characters stay in the object.
    static constexpr unsigned int INLINE_CHARS = 128;

    // The empty value: numeric 0, empty text, no name, no flags, no set.
    ExpValue();
    ExpValue(const ExpValue& other);
    ExpValue& operator=(const ExpValue& other);
    ~ExpValue();

    // Replaces the text; null leaves the text empty.  False only when the
    // block for a long text could not be allocated (the text is then empty).
    // The type is not changed.
    bool setStringValue(wchar_t const* text);
    // The same for a text of exactly length characters (no end mark needed).
    bool setStringValue(wchar_t const* text, size_t length);
    // Never null.  Writable so that FileMaskLookup::find may work in place.
    wchar_t* getStringValue() const { return value; }
    size_t getStringLength() const;
    // True while the text lives in the object.
    bool isInline() const { return value == valueBuffer; }

    // The column name the value came from; null leaves it empty.
    bool setNValueString(wchar_t const* text);
    wchar_t const* getNValueString() const { return nValue; }
    // True when the name is not empty.
    bool hasName() const { return nValue[0] != L'\0'; }

    // Makes this a numeric value (text untouched).
    void setNumericValue(unsigned long long n) {
        type = EXP_NUMERIC;
        number = n;
    }
    // Makes this a string value with the given text.
    bool setString(wchar_t const* text) {
        type = EXP_STRING;
        return setStringValue(text);
    }

    // Back to the empty value: text, name, number, flags and set all cleared.
    void clear();

    bool isNumeric() const { return type == EXP_NUMERIC; }
    bool isString() const { return type == EXP_STRING; }
    char getType() const { return static_cast<char>(type); }
    void setType(char t) { type = static_cast<unsigned char>(t); }
    unsigned long long getNumber() const { return number; }
    void setNumber(unsigned long long n) { number = n; }

private:
    static bool assign(wchar_t* inlineBuffer, wchar_t** current, wchar_t const* text,
                       size_t length);
    static void release(wchar_t* inlineBuffer, wchar_t** current);

    wchar_t valueBuffer[INLINE_CHARS];
    wchar_t* value;
    wchar_t nValueBuffer[INLINE_CHARS];
    wchar_t* nValue;

public:
    // 0 numeric, 1 string.
    unsigned char type;
    // The value came from a literal.
    int32_t isConstant;
    // The value came from a field or a variable.
    int32_t isField;
    // The number; read as signed by comparisons and division.
    unsigned long long number;
    // The set of a set literal; not owned, copied by assignment.
    FileMaskLookup* lookup;
};

// A host function of one argument.  Returns 0 on success; result is the
// command's to fill, type included.
class UnaryCmd {
public:
    virtual int execute(ExpValue const& argument, ExpValue& result) = 0;
    virtual ~UnaryCmd() {}
};

// A host function of two arguments.  Returns 0 on success.
class BinaryCmd {
public:
    virtual int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) = 0;
    virtual ~BinaryCmd() {}
};

// One entry of the command table.  The command object is not owned.
struct CmdToken {
    static constexpr unsigned int MAX_NAME = 32;

    CmdToken() : argumentCount(0), returnType(0) {
        name[0] = L'\0';
        command.unary = nullptr;
    }

    wchar_t name[MAX_NAME + 1];
    unsigned char argumentCount;
    char returnType;
    std::vector<char> argumentTypes;
    union {
        UnaryCmd* unary;
        BinaryCmd* binary;
    } command;
};

// The process-wide command table.
std::vector<CmdToken>& cmdTokenTable();

// Empty value of a type: number 0 for 0, text "" for 1; false for another
// type (the value is then untouched).  Name, flags and set are cleared.
bool resetExpValue(char type, ExpValue& value);

// value <relop> other, unsigned, with the relational operator numbers
// 0 ==, 1 >=, 2 <=, 3 >, 4 <, 5 !=.  False for a relop above 5.
bool checkSimpleExpression(unsigned char value, unsigned int relop, unsigned char other);
bool checkSimpleExpression(unsigned short value, unsigned int relop, unsigned short other);
bool checkSimpleExpression(unsigned int value, unsigned int relop, unsigned int other);
bool checkSimpleExpression(unsigned long long value, unsigned int relop, unsigned long long other);
// The same for unsigned long, so that uint64_t and size_t arguments resolve
// on every target.
bool checkSimpleExpression(unsigned long value, unsigned int relop, unsigned long other);
// Texts: == is a wildcard match with other as the pattern, != its negation,
// the others order by wcsvccmp(value, other).  Null texts give false.
bool checkSimpleExpression(wchar_t const* value, unsigned int relop, wchar_t const* other,
                           bool caseSensitive);

// Operator semantics shared by the direct pass and the tree walk.  Inputs
// have passed the type checks of their level.
//
// Numbers under an arithmetic operator (0 +, 2 -, 4 *, 5 /, 6 &, 7 |): +, -,
// * wrap at 64 bits, / is signed (the one overflow, the smallest number
// divided by -1, wraps to itself), & and | are bitwise.  False for a zero
// divisor and for an operator number outside that list.
bool expArithmetic(unsigned int op, unsigned long long left, unsigned long long right,
                   unsigned long long* result);
// Numbers under a relational operator: signed 64-bit comparison.
bool expCompareNumbers(unsigned int relop, unsigned long long left, unsigned long long right);
// Texts under a relational operator.  == and != look right up as a set when
// it carries one, else as a wildcard pattern when it holds "*" or "?", else
// compare exactly; the other four order left against right.  Wildcards and
// sets count on the right side only.
bool expCompareStrings(unsigned int relop, ExpValue const& left, ExpValue const& right,
                       bool caseSensitive);
// left followed by right into result (a string value).  False when the total
// would reach EXP_MAX_STRING characters or the block can't be had.
bool expConcatenate(ExpValue const& left, ExpValue const& right, ExpValue& result);

#endif
