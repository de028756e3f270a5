// The query language as the rest of the system sees it.
//
// CriteriaEvaluator is one compiled expression bound to a Fields of columns
// and a Fields of variables, checked again and again as the field values
// change.  The first check parses the text (and evaluates it on the way);
// every later check walks the tree the parse left.  It also tells a cursor
// whether the expression can be answered by a hash-index lookup.
//
// Evaluator is a separate, tiny evaluator of strings of boolean digits.
//
// Neither class locks; the command table behind the analyzer is shared by the
// process, so one expression is parsed at a time.
#ifndef FSCANNER_FSCOMMON_CRITERIA_H
#define FSCANNER_FSCOMMON_CRITERIA_H

#include "fscanner/fscommon/expvalue.h"

class Fields;
class SyntaxAnalyzer;

class CriteriaEvaluator {
public:
    // Copies criteria.  A null text leaves the evaluator invalid: no analyzer
    // is made, check gives -1 and the setters refuse.
    explicit CriteriaEvaluator(wchar_t const* criteria);
    ~CriteriaEvaluator();
    CriteriaEvaluator(const CriteriaEvaluator&) = delete;
    CriteriaEvaluator& operator=(const CriteriaEvaluator&) = delete;

    // The expression text; null for an invalid evaluator.
    wchar_t const* getCriteria() const { return criteria; }
    // Bind the columns or the variables (not owned).  False, storing
    // nothing, when invalid or for a null argument.
    bool setFields(Fields* source);
    bool setVariables(Fields* source);

    // Evaluates; a null argument takes the bound one.  The low 32 bits of the
    // result's number: 1 for a match of a relational expression, 0 for none;
    // -1 when invalid or when the pass failed.  The first call parses, later
    // calls walk the tree (even when the first parse failed).
    int check(Fields* fields, Fields* variables, bool caseSensitive);
    int check(bool caseSensitive);

    // Command registration, forwarded to the analyzer; false without one.
    bool addCmd(wchar_t const* name, char returnType, char argumentType, UnaryCmd* command);
    bool addCmd(wchar_t const* name, char returnType, char firstType, char secondType,
                BinaryCmd* command);
    bool findCmd(wchar_t const* name, char argumentType);
    bool findCmd(wchar_t const* name, char firstType, char secondType);

    // The one comparison of a column with a literal that a hash index can
    // answer: its column name (getNValueString), type (0 number, 1 text) and
    // value.  Null when invalid, without bound fields, or when there is none.
    // The first call parses the text with commands switched off; the result
    // is kept, so a later call gives the same object back (empty when there
    // was no candidate).  Owned by the evaluator.
    ExpValue* getHashInfo();
    // Forces a lookup: copies value into the hash information.  False when
    // invalid.
    bool setHashInfo(ExpValue& value);

    // True when the last pass failed.
    bool hasFailed() const { return failed; }
    bool isValid() const { return valid; }
    // The analyzer (null when invalid); for inspection.
    SyntaxAnalyzer* getAnalyzer() const { return analyzer; }

private:
    SyntaxAnalyzer* analyzer;
    wchar_t* criteria;
    bool valid;
    bool firstCheck;
    bool failed;
    ExpValue* hashInfo;
    ExpValue result;
    Fields* fields;
    Fields* variables;
};

// Evaluates texts of the characters 0 1 ( ) ! & | without blanks:
//   orExp   := andExp { "|" andExp }
//   andExp  := simpExp { "&" simpExp }
//   simpExp := "(" orExp ")" | "!" orExp | "0" | "1"
// "!" negates a whole orExp: "!0&0" is the negation of "0&0", true.  Both
// sides of & and | are always evaluated.
class Evaluator {
public:
    Evaluator();
    // The value of text.  Any other character, an unclosed parenthesis, text
    // after the end, a null text or nesting deeper than 1000 sets the error and
    // gives false.
    bool execute(wchar_t const* text);
    bool error() const { return errorFlag; }

private:
    bool orExp();
    bool andExp();
    bool simpExp();
    void advance();

    unsigned int index;
    wchar_t current;
    wchar_t const* text;
    bool errorFlag;
    // Open parentheses and negations; past MAX_DEPTH the text is refused
    // rather than recursing without bound.
    unsigned int depth;
    static constexpr unsigned int MAX_DEPTH = 1000;
};

#endif
