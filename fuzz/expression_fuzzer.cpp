// Compiles and evaluates an arbitrary expression: CriteriaEvaluator::check
// twice (the first pass parses and evaluates, the second walks the tree)
// with other field values in between, getHashInfo on a second evaluator,
// and the boolean-digit Evaluator on the same text.
//
// Input: 1 flag byte (bit 0 case-sensitive), then the expression, one wide
// character per byte.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/syntaxanalyzer.h"
#include "fuzz_support.h"

// A FileMaskLookup made by a set literal lives as long as the expression
// that named it, and nothing frees it when the expression dies: the leak
// checker is told about those two allocation sites only.
extern "C" const char* __lsan_default_suppressions() {
    return "leak:FileMaskLookup::insert\nleak:FileMaskLookup::commit_transaction\n";
}

namespace {

class PathCommand : public BinaryCmd {
public:
    int execute(ExpValue const& first, ExpValue const& second, ExpValue& result) override {
        if (second.type == EXP_STRING && first.number == 7) {
            result.setString(L"/data/report.txt");
            return 0;
        }
        result.setString(L"/");
        return 0;
    }
};

class TypeCommand : public BinaryCmd {
public:
    int execute(ExpValue const&, ExpValue const& second, ExpValue& result) override {
        result.setNumericValue(second.type == EXP_STRING ? 1 : 0);
        return 0;
    }
};

class LengthCommand : public UnaryCmd {
public:
    int execute(ExpValue const& argument, ExpValue& result) override {
        if (argument.type != EXP_STRING) return 1;  // a failing command
        result.setNumericValue(7);
        return 0;
    }
};

// The command table is the process's and a new analyzer starts it afresh,
// so every evaluator registers the commands again, as the engine does.
void registerCommands(CriteriaEvaluator& evaluator) {
    static PathCommand path;
    static TypeCommand type;
    static LengthCommand length;
    evaluator.addCmd(L"path", EXP_STRING, EXP_NUMERIC, EXP_STRING, &path);
    evaluator.addCmd(L"type", EXP_NUMERIC, EXP_STRING, EXP_STRING, &type);
    evaluator.addCmd(L"len", EXP_NUMERIC, EXP_STRING, &length);
}

void fill(Fields& fields, Fields& variables, unsigned int round) {
    static_cast<TextField*>(fields.name(L"NAME"))->value(round == 0 ? L"report.txt" : L"");
    static_cast<Int64Field*>(fields.name(L"SIZE"))->value(round == 0 ? 1200ull : ~0ull);
    static_cast<Int32Field*>(fields.name(L"DIRID"))->value(round == 0 ? 7u : 0u);
    static_cast<Int32Field*>(fields.name(L"A"))->value(round);
    static_cast<Int16Field*>(fields.name(L"B"))->value(2);
    static_cast<Int8Field*>(fields.name(L"C"))->value(3);
    static_cast<Int32Field*>(variables.name(L"pathid"))->value(7u);
    static_cast<TextField*>(variables.name(L"vs"))->value(round == 0 ? L"x" : L"long value of the variable");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    fuzzsupport::ByteReader in(data, size);
    bool caseSensitive = (in.byte() & 1) != 0;
    std::string bytes = in.rest();
    std::wstring text;
    text.reserve(bytes.size());
    for (char c : bytes) text.push_back(static_cast<wchar_t>(static_cast<unsigned char>(c)));

    Fields fields;
    fields.add(L"NAME", FIELD_TEXT);
    fields.add(L"SIZE", FIELD_INT64);
    fields.add(L"DIRID", FIELD_INT32);
    fields.add(L"A", FIELD_INT32);
    fields.add(L"B", FIELD_INT16);
    fields.add(L"C", FIELD_INT8);
    fields.add(L"H", FIELD_HEX);
    Fields variables;
    variables.add(L"pathid", FIELD_INT32);
    variables.add(L"vs", FIELD_TEXT);

    {
        CriteriaEvaluator evaluator(text.c_str());
        registerCommands(evaluator);
        evaluator.setFields(&fields);
        evaluator.setVariables(&variables);
        fill(fields, variables, 0);
        int first = evaluator.check(caseSensitive);
        bool firstFailed = evaluator.hasFailed();
        fill(fields, variables, 1);
        int second = evaluator.check(caseSensitive);
        if (std::getenv("FSCANNER_FUZZ_VERBOSE") != nullptr)
            std::fprintf(stderr, "check: %d%s, then %d%s\n", first, firstFailed ? " (failed)" : "", second,
                         evaluator.hasFailed() ? " (failed)" : "");
    }
    {
        CriteriaEvaluator evaluator(text.c_str());
        registerCommands(evaluator);
        evaluator.setFields(&fields);
        evaluator.getHashInfo();
        evaluator.getHashInfo();
    }
    Evaluator digits;
    digits.execute(text.c_str());
    return 0;
}
