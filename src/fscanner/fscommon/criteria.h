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

#include <string>
#include <vector>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/wildcard.h"

class Fields;
class SyntaxAnalyzer;
class TreeNode;

// A test that a cursor can put to the stored UTF-8 bytes of one text column
// before it decodes a row: false only for a row on which the expression is
// certainly 0 and whose evaluation would have had no effect on the way (no
// command run, no failure traced), so that passing the row over unread
// changes nothing but the time.  It knows the comparisons `[COLUMN]=="mask"`
// of one column, comparisons of integer columns with numbers, and && and ||
// over those, in the order the tree walk takes them; any other part counts as
// possibly true and possibly acting.  A mask comparison gives an answer only
// when both the mask and the stored name are plain ASCII: there the byte form
// and the wide form agree character for character, also under the
// case-insensitive rule (the fold table is that of towlower).  Beyond ASCII,
// where folding or a "?" over a multibyte character could answer otherwise,
// the row goes the full way, and the evaluator decides every row the test
// lets through.
class NameMaskFilter {
public:
    // From a parsed tree, for the columns in fields.  usable() is false when
    // the tree holds no mask comparison on a text column.
    NameMaskFilter(TreeNode* root, Fields* fields);
    bool usable() const { return column >= 0; }
    // Position of the column in the fields the filter was built for.
    unsigned int getColumn() const { return static_cast<unsigned int>(column); }
    // False when a row whose column holds [text, text + length) can not
    // satisfy the expression; true when it may.
    bool mayMatch(const unsigned char* text, size_t length, bool caseSensitive) const;
    // The same for a text known to be plain ASCII.  Inline: a walk over a
    // table asks it for every row.
    bool mayMatchAscii(const unsigned char* text, size_t length, bool caseSensitive) const {
        if (root < 0 || text == nullptr) return true;
        // The usual query, "*.ext" alone, without the walk over the nodes.
        Node const& top = nodes[static_cast<size_t>(root)];
        if (top.kind == MASK && top.suffixOnly) return endsWithTail(top, text, length, caseSensitive);
        return evaluate(root, text, length, caseSensitive) != FALSE_QUIET;
    }
    // True when the expression is the one mask comparison: on a plain ASCII
    // text the byte matcher answers as the evaluator does, so mayMatchAscii
    // is then the expression's verdict, not only a bound on it.
    bool decidesAscii() const { return root >= 0 && nodes[static_cast<size_t>(root)].kind == MASK; }

private:
    enum Kind { AND, OR, MASK, PURE, OTHER };
    // What evaluating a part does: certainly 0 without effects, a value
    // without effects, or anything.
    enum Outcome { FALSE_QUIET, QUIET, ANY };
    struct Node {
        Kind kind;
        int left;
        int right;
        std::string mask;  // MASK: the ASCII pattern
        // MASK of one leading "*" and a tail without "*" and "?": the
        // matcher's answer is then whether the text ends in the tail.
        bool suffixOnly;
    };
    int add(TreeNode* node, Fields* fields, unsigned int depth);
    Outcome evaluate(int node, const unsigned char* text, size_t length, bool caseSensitive) const;
    // A suffixOnly MASK's answer: whether the text ends in the mask's tail.
    bool endsWithTail(Node const& n, const unsigned char* text, size_t length, bool caseSensitive) const {
        // The matcher tries the tail at every start in turn and takes one
        // that ends with the text: a suffix test.
        size_t tail = n.mask.size() - 1;
        if (length < tail) return false;
        const unsigned char* p = reinterpret_cast<const unsigned char*>(n.mask.data()) + 1;
        const unsigned char* t = text + (length - tail);
        // Every byte of a short tail is compared, without a stop at the
        // first difference: where that comes changes from name to name, and
        // the processor's guess at it costs more than the few compares.
        unsigned int differ = 0;
        if (caseSensitive) {
            for (size_t i = 0; i < tail; ++i) differ |= static_cast<unsigned int>(p[i] ^ t[i]);
        } else {
            for (size_t i = 0; i < tail; ++i) differ |= static_cast<unsigned int>(fold.lower[p[i]] ^ fold.lower[t[i]]);
        }
        return differ == 0;
    }

    std::vector<Node> nodes;
    int root = -1;
    int column = -1;
    FoldedByteCase fold;
};

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

    // The byte test of the expression for a cursor over fields, built once
    // from the parsed tree; null when the expression has none or did not
    // parse.  Owned by the evaluator.
    NameMaskFilter const* getNameFilter(Fields* fields);

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
    NameMaskFilter* nameFilter = nullptr;
    Fields* filterFields = nullptr;
    bool nameFilterBuilt = false;
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
