#include "fscanner/fscommon/criteria.h"

#include <cwchar>

#include "base/kelmem.h"
#include "fscanner/fscommon/syntaxanalyzer.h"

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
