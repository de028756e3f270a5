#include "fscanner/fscommon/fileprocessor.h"

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/stringhelper.h"

// ------------------------------------------------------------ fpPathCommand

int fpPathCommand::execute(ExpValue const&, ExpValue const&, ExpValue& result) {
    result.setString(L"");
    if (info != nullptr) {
        wchar_t* full = getFullPathName(info->getPath(), info->getName());
        if (full != nullptr) {
            result.setStringValue(full);
            kelm_free(full);
        }
    }
    return 0;
}

// ------------------------------------------------------------ fpTypeCommand

fpTypeCommand::fpTypeCommand() : log(getQvLogFs()) {}

int fpTypeCommand::execute(ExpValue const& first, ExpValue const& second, ExpValue& result) {
    wchar_t const* path = first.getStringValue();
    wchar_t const* wanted = second.getStringValue();
    if (path == nullptr || wanted == nullptr) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "fpTypeCommand::execute - args not valid!\n");
        return 1;
    }
    StringList<wchar_t> types;
    types.insert(wanted);
    result.setNumericValue(checker.check(path, types) ? 1 : 0);
    return 0;
}

// ------------------------------------------------------------ FileProcessor

namespace {
FileProcessor::CriteriaObserver criteriaObserver = nullptr;
}

void FileProcessor::setCriteriaObserver(CriteriaObserver observer) { criteriaObserver = observer; }

FileProcessor::FileProcessor(const wchar_t* criteria, bool isCaseSensitive)
    : caseSensitive(isCaseSensitive),
      evaluator(nullptr),
      typeCommand(nullptr),
      pathCommand(nullptr),
      processingFlags(PROCESS_DEFAULT),
      hashes(nullptr) {
    initialize(criteria);
}

FileProcessor::FileProcessor(const wchar_t* criteria, bool isCaseSensitive, unsigned int flags,
                             FileHashBlackBox* knownHashes)
    : caseSensitive(isCaseSensitive),
      evaluator(nullptr),
      typeCommand(nullptr),
      pathCommand(nullptr),
      processingFlags(flags),
      hashes(knownHashes) {
    initialize(criteria);
}

// Columns first, then the evaluator (whose analyzer empties the process-wide
// command table), then this processor's two commands.  For a null expression
// the evaluator is invalid and refuses both the commands and the fields; the
// processor then answers false for every file.
void FileProcessor::initialize(const wchar_t* criteria) {
    fields.add(L"FILENAME", FIELD_TEXT);
    fields.add(L"SHORTFILENAME", FIELD_TEXT);
    fields.add(L"SIZE", FIELD_INT64);
    fields.add(L"ATTR", FIELD_INT32);
    fields.add(L"PATHID", FIELD_INT32);
    fields.add(L"MD5", FIELD_TEXT);
    fields.add(L"CRC32", FIELD_INT32);
    fields.add(L"Q32", FIELD_INT32);
    evaluator = new CriteriaEvaluator(criteria);
    typeCommand = new fpTypeCommand();
    pathCommand = new fpPathCommand();
    evaluator->addCmd(L"path", EXP_STRING, EXP_NUMERIC, EXP_STRING, pathCommand);
    evaluator->addCmd(L"type", EXP_NUMERIC, EXP_STRING, EXP_STRING, typeCommand);
    evaluator->setFields(&fields);
}

FileProcessor::~FileProcessor() {
    delete evaluator;
    delete typeCommand;
    delete pathCommand;
}

bool FileProcessor::satisfyCriteria(const FsFileInfo& info, const FileChecksumInfo& checksums,
                                    const wchar_t* shortName) {
    if (criteriaObserver != nullptr) criteriaObserver(info, checksums, shortName);

    // Column positions are fixed by initialize.
    static_cast<TextField*>(fields.at(0))->value(info.getName());
    if (shortName != nullptr) static_cast<TextField*>(fields.at(1))->value(shortName);
    static_cast<Int64Field*>(fields.at(2))->value(info.getSize());
    static_cast<Int32Field*>(fields.at(3))->value(info.getAttr());
    static_cast<TextField*>(fields.at(5))->value(L"0");
    static_cast<Int32Field*>(fields.at(6))->value(0);
    static_cast<Int32Field*>(fields.at(7))->value(0);

    pathCommand->setFsFileInfo(&info);
    int matched = evaluator->check(caseSensitive);
    // The file is gone once the walk moves on: path() must not see it later.
    pathCommand->setFsFileInfo(nullptr);
    if (matched != 1) return false;
    return hashes != nullptr ? hashes->find(checksums) : true;
}
