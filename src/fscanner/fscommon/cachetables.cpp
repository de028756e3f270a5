#include "fscanner/fscommon/cachetables.h"

#include <string>

#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/table.h"

namespace cachetables {
wchar_t const* const directoryColumns[DIRECTORY_COLUMNS] = {L"ID", L"PATHNAME", L"PARENTID",
                                                            L"CREATIONTIME"};
unsigned int const directoryTypes[DIRECTORY_COLUMNS] = {TYPE_INT32, TYPE_TEXT, TYPE_INT32,
                                                        TYPE_INT32};
wchar_t const* const directoryIndexes[3] = {L"PATHNAME", L"ID", L"PARENTID"};
wchar_t const* const fileColumns[FILE_COLUMNS] = {L"FILENAME", L"ATTR", L"SIZE", L"PATHID",
                                                  L"MD5", L"CRC32", L"Q32"};
unsigned int const fileTypes[FILE_COLUMNS] = {TYPE_TEXT, TYPE_INT32, TYPE_INT64, TYPE_INT32,
                                              TYPE_TEXT, TYPE_INT32, TYPE_INT32};
wchar_t const* const fileIndexes[2] = {L"FILENAME", L"PATHID"};
wchar_t const* const variableNames[10] = {L"id", L"pathid", L"parentid", L"pathname",
                                          L"shortpathname", L"filename", L"shortfilename",
                                          L"md5", L"crc32", L"q32"};
unsigned int const variableTypes[10] = {TYPE_INT32, TYPE_INT32, TYPE_INT32, TYPE_TEXT, TYPE_TEXT,
                                        TYPE_TEXT, TYPE_TEXT, TYPE_TEXT, TYPE_INT32, TYPE_INT32};
wchar_t const* const criteriaTexts[7] = {
    L"[PATHID]==pathid",
    L"[PARENTID]==parentid",
    L"[ID]==id",
    L"[SHORTPATHNAME]==shortpathname || [PATHNAME]==pathname",
    L"[PATHNAME]==pathname",
    L"[PATHID]==pathid && ([FILENAME]==filename || [SHORTFILENAME]==shortfilename)",
    L"[PATHID]==pathid && [FILENAME]==filename"};
}  // namespace cachetables

namespace {

bool createTable(FS_Table** slot, wchar_t const* name, wchar_t const* dir, bool flag,
                 wchar_t const* const* columns, unsigned int const* types, unsigned int count,
                 wchar_t const* const* indexes, unsigned int indexCount)
{
    *slot = nullptr;
    if (name == nullptr || dir == nullptr)
        return false;
    FS_Table* table = new FS_Table(name, dir, flag);
    bool ok = true;
    for (unsigned int i = 0; i < count && ok; ++i)
        ok = table->addField(columns[i], types[i]);
    ok = ok && table->create();
    for (unsigned int i = 0; i < indexCount && ok; ++i) {
        std::wstring indexName = std::wstring(name) + L"_" + indexes[i];
        ok = table->addHashIndex(indexName.c_str(), indexes[i]);
    }
    if (!ok) {
        delete table;
        return false;
    }
    *slot = table;
    return true;
}

}  // namespace

bool FS_CacheBase::createDirectoriesTable(FS_Table** slot, wchar_t const* name)
{
    return createTable(slot, name, cachePathName, tableFlag, cachetables::directoryColumns,
                       cachetables::directoryTypes, cachetables::DIRECTORY_COLUMNS,
                       cachetables::directoryIndexes, 3);
}

bool FS_CacheBase::createFilesTable(FS_Table** slot, wchar_t const* name)
{
    return createTable(slot, name, cachePathName, tableFlag, cachetables::fileColumns,
                       cachetables::fileTypes, cachetables::FILE_COLUMNS, cachetables::fileIndexes,
                       2);
}

bool FS_CacheBase::buildLookups()
{
    defaultVariables = new Fields();
    for (int i = 0; i < 10; ++i) {
        if (!defaultVariables->add(cachetables::variableNames[i], cachetables::variableTypes[i]) ||
            (variableHandles[i] = defaultVariables->name(cachetables::variableNames[i])) == nullptr) {
            log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - defaultVariables error!", className,
                          __func__);
            return false;
        }
    }
    for (int i = 0; i < 7; ++i) {
        criteria[i] = new CriteriaEvaluator(cachetables::criteriaTexts[i]);
        if (!criteria[i]->setVariables(defaultVariables)) {
            log->traceMIN(__LINE__, __FILE__, __func__, "%s::%s - criteriaEvaluator creation error!",
                          className, __func__);
            return false;
        }
    }
    return true;
}

void FS_CacheBase::deleteLookups()
{
    for (int i = 0; i < 7; ++i) {
        delete criteria[i];
        criteria[i] = nullptr;
    }
    for (int i = 0; i < 10; ++i)
        variableHandles[i] = nullptr;
    delete defaultVariables;
    defaultVariables = nullptr;
}
