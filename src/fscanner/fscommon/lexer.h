// Tokens of the query language and the lexer that cuts an expression into
// them, one nextToken() at a time, with one step of push-back.
//
// Token types and their numbers:
//   0 number (numericValue)      1 string or set (text; a set has lookup)
//   2 field [NAME] (text)        3 variable (text)
//   4 arithmetic operator: 0 +, 2 -, 4 *, 5 /, 6 &, 7 |
//     (1 unary plus and 3 unary minus are made by the parser only)
//   5 parenthesis: 0 (, 1 )      6 boolean: 0 &&, 1 ||, 2 !
//   7 relational: 0 ==, 1 >=, 2 <=, 3 >, 4 <, 5 !=
//   8 command (numericValue = index in the command table, text = its name)
//   9 sign: 0 ., 1 ,, 2 ;        255 end of input or nothing recognised
//
// The only blank is the character 32.  Tabs and line ends are unrecognised
// characters, and so are blanks behind the last token: the end test comes
// before blanks are skipped.  The lexer never traces and never throws.
#ifndef FSCANNER_FSCOMMON_LEXER_H
#define FSCANNER_FSCOMMON_LEXER_H

#include <cstddef>
#include <vector>

#include "fscanner/fscommon/expvalue.h"

class FileMaskLookup;

const unsigned char TOKEN_NUMBER = 0;
const unsigned char TOKEN_STRING = 1;
const unsigned char TOKEN_FIELD = 2;
const unsigned char TOKEN_VARIABLE = 3;
const unsigned char TOKEN_ARITHMETIC = 4;
const unsigned char TOKEN_PARENTHESIS = 5;
const unsigned char TOKEN_BOOLEAN = 6;
const unsigned char TOKEN_RELATIONAL = 7;
const unsigned char TOKEN_COMMAND = 8;
const unsigned char TOKEN_SIGN = 9;
const unsigned char TOKEN_END = 255;

// Arithmetic operator numbers.
const unsigned int OP_PLUS = 0;
const unsigned int OP_UNARY_PLUS = 1;
const unsigned int OP_MINUS = 2;
const unsigned int OP_UNARY_MINUS = 3;
const unsigned int OP_MULTIPLY = 4;
const unsigned int OP_DIVIDE = 5;
const unsigned int OP_AND = 6;
const unsigned int OP_OR = 7;
// Boolean operator numbers.
const unsigned int OP_LOGICAL_AND = 0;
const unsigned int OP_LOGICAL_OR = 1;
const unsigned int OP_NOT = 2;
// Relational operator numbers.
const unsigned int OP_EQUAL = 0;
const unsigned int OP_GREATER_EQUAL = 1;
const unsigned int OP_LESS_EQUAL = 2;
const unsigned int OP_GREATER = 3;
const unsigned int OP_LESS = 4;
const unsigned int OP_NOT_EQUAL = 5;

// Longest content of a string, set or field literal, in characters.
const size_t LEXER_MAX_LITERAL = 4194303;
// Longest variable name, in characters.
const size_t LEXER_MAX_VARIABLE = 1048575;

// A token: deep-copying value.  The set of a set literal (lookup) is not
// owned by the token; the Lexer that made it releases it.
class fsToken {
public:
    static constexpr unsigned int INLINE_CHARS = 128;

    // An end token: type 255, number 0, empty text.
    fsToken();
    fsToken(const fsToken& other);
    fsToken& operator=(const fsToken& other);
    ~fsToken();

    void setType(unsigned char t) { type = t; }
    unsigned char getType() const { return type; }
    void setNumericValue(unsigned long long n) { numericValue = n; }
    unsigned long long getNumericValue() const { return numericValue; }
    // Replaces the text (null leaves it empty).  False when a long text's
    // block could not be allocated; the text is then empty.
    bool setStringValue(wchar_t const* text);
    // Copies exactly length characters and adds the end mark.
    bool setStringValue(wchar_t const* text, unsigned int length);
    // Never null.
    wchar_t const* getStringValue() const { return text; }
    // True while the text lives in the token.
    bool isInline() const { return text == buffer; }

private:
    bool assign(wchar_t const* source, size_t length);

    wchar_t buffer[INLINE_CHARS];
    wchar_t* text;

public:
    unsigned char type;
    // Set only by a set literal; not released by the token.
    FileMaskLookup* lookup;
    // The tree walk keeps the value of a set operand here, computed once.
    ExpValue value;
    unsigned long long numericValue;
};

class Lexer {
public:
    // getLastError() values.
    static constexpr int LEX_OK = 0;
    static constexpr int LEX_END = 1;
    static constexpr int LEX_NOTHING = 2;

    // No expression: nextToken gives type 255 with error 2.
    Lexer();
    // Releases the text and every set this lexer built.
    ~Lexer();
    Lexer(const Lexer&) = delete;
    Lexer& operator=(const Lexer&) = delete;

    // Takes a copy of text and starts at its beginning with error 0.  Null
    // clears text and position and sets error 2.  The sets built for the
    // previous text are released here, so tokens and trees that still point
    // at them must be dropped first or not be walked again.
    void setExpression(wchar_t const* text);
    // The next token.  See the recogniser rules in lexer.cpp.
    fsToken nextToken();
    // Moves back to where the last nextToken started.  One step only.
    void back();
    // Moves to the start of the text; false when there is none.
    bool restart();
    // 0 a token was delivered, 1 end of input, 2 nothing recognised or no
    // expression.
    int getLastError() const { return lastError; }

private:
    bool recogniseSet(size_t start);
    bool recogniseNumber(size_t start);
    bool recogniseSign(size_t start);
    bool recogniseCommand(size_t start);
    bool recogniseVariable(size_t start);
    bool recogniseField(size_t start);
    bool recogniseString(size_t start);
    bool recogniseRelational(size_t start);
    bool recogniseBoolean(size_t start);
    bool recogniseArithmetic(size_t start);
    bool recogniseParenthesis(size_t start);
    // A literal over the size limit: back to the token's start, and the
    // previous token is delivered once more as if it had been read.
    bool refuse();
    void releaseLookups();

    wchar_t* text;
    size_t position;
    size_t lastStart;
    int lastError;
    fsToken token;
    // Sets built for the current text; owned.  A set may be read more than
    // once when the parser backs up, so each reading's set is kept here.
    std::vector<FileMaskLookup*> lookups;
    // Where the last refusal happened; a second read there gives nothing
    // recognised, so that a parser can't loop on the repeated token.
    size_t refusedAt;
};

#endif
