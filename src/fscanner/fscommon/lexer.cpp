#include "fscanner/fscommon/lexer.h"

#include <cwchar>

#include "base/kelmem.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/stringhelper.h"

namespace {

const size_t NO_POSITION = static_cast<size_t>(-1);
// A number literal is copied to an area of this many bytes before it is
// converted; longer literals are cut (the conversion reads 23 digits at most).
const size_t NUMBER_AREA_BYTES = 1024;

bool isLetter(wchar_t c) {
    return (c >= L'A' && c <= L'Z') || (c >= L'a' && c <= L'z');
}

bool isDigit(wchar_t c) {
    return c >= L'0' && c <= L'9';
}

// Where the literal opened at start closes: the first closer behind it, or
// NO_POSITION when the text ends first.
size_t closingPosition(wchar_t const* text, size_t start, wchar_t closer) {
    size_t end = start + 1;
    while (text[end] != L'\0' && text[end] != closer) {
        ++end;
    }
    return text[end] == closer ? end : NO_POSITION;
}

// Makes token a token of type whose text is the length characters at from.
// False, token untouched, when the text can not be stored.
bool textToken(fsToken& token, unsigned char type, wchar_t const* from, size_t length) {
    fsToken made;
    made.setType(type);
    if (!made.setStringValue(from, static_cast<unsigned int>(length))) {
        return false;
    }
    token = made;
    return true;
}

}  // namespace

// ---------------------------------------------------------------- fsToken

fsToken::fsToken() : text(buffer), type(TOKEN_END), lookup(nullptr), numericValue(0) {
    buffer[0] = L'\0';
}

fsToken::fsToken(const fsToken& other) : fsToken() {
    *this = other;
}

fsToken& fsToken::operator=(const fsToken& other) {
    if (this == &other) {
        return *this;
    }
    assign(other.text, wcslen(other.text));
    type = other.type;
    lookup = other.lookup;
    value = other.value;
    numericValue = other.numericValue;
    return *this;
}

fsToken::~fsToken() {
    if (text != buffer) {
        kelm_free(text);
    }
}

bool fsToken::assign(wchar_t const* source, size_t length) {
    if (text != buffer) {
        kelm_free(text);
        text = buffer;
    }
    buffer[0] = L'\0';
    if (source == nullptr) {
        return true;
    }
    wchar_t* target = buffer;
    if (length >= INLINE_CHARS) {
        target = static_cast<wchar_t*>(kelm_malloc((length + 1) * sizeof(wchar_t)));
        if (target == nullptr) {
            return false;
        }
    }
    wmemcpy(target, source, length);
    target[length] = L'\0';
    text = target;
    return true;
}

bool fsToken::setStringValue(wchar_t const* source) {
    return assign(source, source != nullptr ? wcslen(source) : 0);
}

bool fsToken::setStringValue(wchar_t const* source, unsigned int length) {
    return assign(source, length);
}

// ---------------------------------------------------------------- Lexer

Lexer::Lexer()
    : text(nullptr), position(0), lastStart(0), lastError(LEX_NOTHING), refusedAt(NO_POSITION) {}

Lexer::~Lexer() {
    kelm_free(text);
    releaseLookups();
}

void Lexer::releaseLookups() {
    for (FileMaskLookup* lookup : lookups) {
        delete lookup;
    }
    lookups.clear();
}

void Lexer::setExpression(wchar_t const* expression) {
    kelm_free(text);
    text = nullptr;
    releaseLookups();
    position = 0;
    lastStart = 0;
    refusedAt = NO_POSITION;
    token = fsToken();
    if (expression == nullptr) {
        lastError = LEX_NOTHING;
        return;
    }
    size_t length = wcslen(expression);
    text = static_cast<wchar_t*>(kelm_malloc((length + 1) * sizeof(wchar_t)));
    if (text == nullptr) {
        lastError = LEX_NOTHING;
        return;
    }
    wmemcpy(text, expression, length + 1);
    lastError = LEX_OK;
}

bool Lexer::restart() {
    if (text == nullptr) {
        return false;
    }
    position = 0;
    return true;
}

void Lexer::back() {
    position = lastStart;
}

fsToken Lexer::nextToken() {
    lastStart = position;
    if (text == nullptr) {
        lastError = LEX_NOTHING;
        token = fsToken();
        return token;
    }
    if (text[position] == L'\0') {
        token = fsToken();
        lastError = LEX_END;
        return token;
    }
    if (position != refusedAt) {
        size_t start = position;
        while (text[start] == L' ') {
            ++start;
        }
        // Each recogniser starts behind the blanks and, when it fails, the
        // position stays there.
        position = start;
        if (recogniseSet(start) || recogniseNumber(start) || recogniseSign(start) ||
            recogniseCommand(start) || recogniseVariable(start) || recogniseField(start) ||
            recogniseString(start) || recogniseRelational(start) || recogniseBoolean(start) ||
            recogniseArithmetic(start) || recogniseParenthesis(start)) {
            lastError = LEX_OK;
            return token;
        }
    }
    token = fsToken();
    lastError = LEX_NOTHING;
    return token;
}

bool Lexer::refuse() {
    position = lastStart;
    refusedAt = lastStart;
    return true;
}

bool Lexer::recogniseSet(size_t start) {
    if (text[start] != L'{') {
        return false;
    }
    size_t end = closingPosition(text, start, L'}');
    if (end == NO_POSITION) {
        return false;
    }
    size_t length = end - start - 1;
    if (length > LEXER_MAX_LITERAL) {
        return refuse();
    }
    if (!textToken(token, TOKEN_STRING, text + start + 1, length)) {
        return false;
    }
    FileMaskLookup* lookup = new FileMaskLookup();
    lookup->insert_stringlist(token.getStringValue());
    lookup->commit_transaction(true);
    lookups.push_back(lookup);
    token.lookup = lookup;
    position = end + 1;
    return true;
}

bool Lexer::recogniseNumber(size_t start) {
    size_t end = start;
    if (isDigit(text[end])) {
        while (isDigit(text[end])) {
            ++end;
        }
        if (text[end] == L'.') {
            if (!isDigit(text[end + 1])) {
                // "1." is no number, and "1" is not delivered either.
                return false;
            }
            ++end;
            while (isDigit(text[end])) {
                ++end;
            }
        }
    } else if (text[end] == L'.' && isDigit(text[end + 1])) {
        ++end;
        while (isDigit(text[end])) {
            ++end;
        }
    } else {
        return false;
    }
    wchar_t area[NUMBER_AREA_BYTES / sizeof(wchar_t)];
    size_t length = end - start;
    const size_t room = sizeof(area) / sizeof(area[0]) - 1;
    if (length > room) {
        length = room;
    }
    wmemcpy(area, text + start, length);
    area[length] = L'\0';
    // A fraction makes the text not all digits, so its value is 0.
    token = fsToken();
    token.setType(TOKEN_NUMBER);
    token.setNumericValue(str2uint64(area));
    position = end;
    return true;
}

bool Lexer::recogniseSign(size_t start) {
    unsigned long long number;
    switch (text[start]) {
        case L'.':
            number = 0;
            break;
        case L',':
            number = 1;
            break;
        case L';':
            number = 2;
            break;
        default:
            return false;
    }
    token = fsToken();
    token.setType(TOKEN_SIGN);
    token.setNumericValue(number);
    position = start + 1;
    return true;
}

bool Lexer::recogniseCommand(size_t start) {
    std::vector<CmdToken>& table = cmdTokenTable();
    for (size_t i = 0; i < table.size(); ++i) {
        size_t length = wcslen(table[i].name);
        // Only the name is consumed: "pathname" is "path" and then "name".
        if (length != 0 && wcsncmp(text + start, table[i].name, length) == 0) {
            token = fsToken();
            token.setType(TOKEN_COMMAND);
            token.setNumericValue(i);
            token.setStringValue(table[i].name);
            position = start + length;
            return true;
        }
    }
    return false;
}

bool Lexer::recogniseVariable(size_t start) {
    if (!isLetter(text[start])) {
        return false;
    }
    size_t end = start + 1;
    while (isLetter(text[end]) || isDigit(text[end])) {
        ++end;
    }
    size_t length = end - start;
    if (length > LEXER_MAX_VARIABLE) {
        return refuse();
    }
    if (!textToken(token, TOKEN_VARIABLE, text + start, length)) {
        return false;
    }
    position = end;
    return true;
}

bool Lexer::recogniseField(size_t start) {
    if (text[start] != L'[' || !isLetter(text[start + 1])) {
        return false;
    }
    size_t end = start + 2;
    while (isLetter(text[end]) || isDigit(text[end])) {
        ++end;
    }
    if (text[end] != L']') {
        return false;
    }
    size_t length = end - start - 1;
    if (length > LEXER_MAX_LITERAL) {
        return refuse();
    }
    if (!textToken(token, TOKEN_FIELD, text + start + 1, length)) {
        return false;
    }
    position = end + 1;
    return true;
}

bool Lexer::recogniseString(size_t start) {
    if (text[start] != L'"') {
        return false;
    }
    size_t end = closingPosition(text, start, L'"');
    if (end == NO_POSITION) {
        return false;
    }
    size_t length = end - start - 1;
    if (length > LEXER_MAX_LITERAL) {
        return refuse();
    }
    if (!textToken(token, TOKEN_STRING, text + start + 1, length)) {
        return false;
    }
    position = end + 1;
    return true;
}

namespace {

struct Spelling {
    wchar_t const* text;
    unsigned long long number;
};

bool matchSpelling(wchar_t const* at, Spelling const* list, size_t count, size_t* length,
                   unsigned long long* number) {
    for (size_t i = 0; i < count; ++i) {
        size_t n = wcslen(list[i].text);
        if (wcsncmp(at, list[i].text, n) == 0) {
            *length = n;
            *number = list[i].number;
            return true;
        }
    }
    return false;
}

const Spelling RELATIONAL[] = {{L"==", 0}, {L">=", 1}, {L"<=", 2},
                               {L">", 3},  {L"<", 4},  {L"!=", 5}};
const Spelling BOOLEAN[] = {{L"&&", 0}, {L"||", 1}, {L"!", 2}};
const Spelling ARITHMETIC[] = {{L"+", 0}, {L"-", 2}, {L"*", 4},
                               {L"/", 5}, {L"&", 6}, {L"|", 7}};
const Spelling PARENTHESIS[] = {{L"(", 0}, {L")", 1}};

}  // namespace

#define FS_LEXER_RECOGNISE_SPELLING(list, tokenType)                                   \
    size_t length = 0;                                                                 \
    unsigned long long number = 0;                                                     \
    if (!matchSpelling(text + start, list, sizeof(list) / sizeof(list[0]), &length,    \
                       &number)) {                                                     \
        return false;                                                                  \
    }                                                                                  \
    token = fsToken();                                                                 \
    token.setType(tokenType);                                                          \
    token.setNumericValue(number);                                                     \
    position = start + length;                                                         \
    return true

bool Lexer::recogniseRelational(size_t start) {
    FS_LEXER_RECOGNISE_SPELLING(RELATIONAL, TOKEN_RELATIONAL);
}

bool Lexer::recogniseBoolean(size_t start) {
    FS_LEXER_RECOGNISE_SPELLING(BOOLEAN, TOKEN_BOOLEAN);
}

bool Lexer::recogniseArithmetic(size_t start) {
    FS_LEXER_RECOGNISE_SPELLING(ARITHMETIC, TOKEN_ARITHMETIC);
}

bool Lexer::recogniseParenthesis(size_t start) {
    FS_LEXER_RECOGNISE_SPELLING(PARENTHESIS, TOKEN_PARENTHESIS);
}

#undef FS_LEXER_RECOGNISE_SPELLING
