#include "fscanner/fscommon/cachetables.h"

#include <algorithm>
#include <cerrno>
#include <cwchar>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/wildcard.h"
#include "fscanner/fscommon/table.h"
#include "fscanner/fscommon/trace.h"

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
// The criteria above that are exactly "[column]==variable" on two INT32s.
Int32Equality const int32Equalities[3] = {
    {CRIT_PATH_ID, L"PATHID", VAR_PATHID}, {CRIT_PARENT_ID, L"PARENTID", VAR_PARENTID}, {CRIT_ID, L"ID", VAR_ID}};
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
    if (!ok) {
        // The reason of the failed create (a full disk, say) stays in errno
        // for the caller: the lock file's removal must not replace it.
        int reason = errno;
        delete table;
        errno = reason;
        return false;
    }
    // A missing index is not fatal: lookups on that column then walk the
    // table through the criteria instead.
    for (unsigned int i = 0; i < indexCount; ++i) {
        std::wstring indexName = std::wstring(name) + L"_" + indexes[i];
        table->addHashIndex(indexName.c_str(), indexes[i]);
    }
    *slot = table;
    return true;
}

// The table has the columns and types given, in order, and every index it
// lists is one of those given, under its own name, once.
bool sameLayout(FS_Table* table, wchar_t const* const* columns, unsigned int const* types,
                unsigned int count, wchar_t const* const* indexes, unsigned int indexCount,
                std::wstring* file, char const** check)
{
    Fields& schema = table->getFields();
    *file = table->getDataPath();
    if (schema.count() != count) {
        *check = "data file header does not hold the cache's columns";
        return false;
    }
    for (unsigned int i = 0; i < count; ++i) {
        Field* field = schema.at(i);
        if (field->getName() == nullptr || wcscmp(field->getName(), columns[i]) != 0 ||
            field->getType() != types[i]) {
            *check = "data file header does not hold the cache's columns";
            return false;
        }
    }
    std::vector<bool> seen(indexCount, false);
    for (Index* index : table->getIndexes()) {
        bool known = false;
        for (unsigned int i = 0; i < indexCount && !known; ++i) {
            std::wstring indexName = std::wstring(table->getName()) + L"_" + indexes[i];
            if (index->getIndexName() != nullptr && index->getFieldName() != nullptr &&
                indexName == index->getIndexName() && wcscmp(index->getFieldName(), indexes[i]) == 0 &&
                !seen[i]) {
                seen[i] = true;
                known = true;
            }
        }
        if (!known) {
            *file = std::wstring(table->getDirectory()) + table->getIndexListName();
            *check = "index list names an index the cache does not make";
            return false;
        }
    }
    return true;
}

}  // namespace

namespace {

char const* const idOutsideCounter = "directory id outside the ids the counter has given";

// The row check of the directories table: the id counter the cache hands
// ids out from, read at each row, since a scan raises it while rows are read.
char const* checkDirectoryRow(void* context, Fields& row)
{
    unsigned int counter = *static_cast<unsigned int const*>(context);
    Field* id = row.name(L"ID");
    Field* parent = row.name(L"PARENTID");
    if (id == nullptr || parent == nullptr || id->getType() != cachetables::TYPE_INT32 ||
        parent->getType() != cachetables::TYPE_INT32)
        return nullptr;
    unsigned int own = static_cast<Int32Field*>(id)->value();
    if (own == 0 || own > counter)
        return idOutsideCounter;
    // Every existing id is one the counter gave: a parent above it cannot
    // exist.  One below it is found or not when the path is rebuilt, and
    // the index checks of each read catch a changed id.
    unsigned int up = static_cast<Int32Field*>(parent)->value();
    if (up > counter)
        return "directory row names a parent that does not exist";
    return nullptr;
}

}  // namespace

bool cachetables::checkCacheTables(FS_Table* directories, FS_Table* files,
                                   unsigned int const* counter, std::wstring* file,
                                   char const** check)
{
    if (directories == nullptr || files == nullptr)
        return true;
    struct Entry {
        FS_Table* table;
        wchar_t const* const* columns;
        unsigned int const* types;
        unsigned int count;
        wchar_t const* const* indexes;
        unsigned int indexCount;
    } const tables[2] = {{directories, directoryColumns, directoryTypes, DIRECTORY_COLUMNS,
                          directoryIndexes, 3},
                         {files, fileColumns, fileTypes, FILE_COLUMNS, fileIndexes, 2}};
    for (Entry const& t : tables) {
        if (!sameLayout(t.table, t.columns, t.types, t.count, t.indexes, t.indexCount, file,
                        check))
            return false;
        if (!t.table->verify()) {
            *file = t.table->damagedFile() != nullptr ? t.table->damagedFile() : L"";
            *check = t.table->damagedCheck() != nullptr ? t.table->damagedCheck() : "table is not open";
            return false;
        }
    }
    // Live rows have distinct ids from 1 to the counter, so there are no
    // more of them than the counter: otherwise one id is outside or two
    // rows share one.
    unsigned int stored = 0;
    if (directories->count(0, &stored) && stored > *counter) {
        *file = directories->getDataPath();
        *check = idOutsideCounter;
        return false;
    }
    directories->setRowCheck(checkDirectoryRow, const_cast<unsigned int*>(counter));
    return true;
}

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
            FS_TRACE(log, MIN, "defaultVariables error!");
            return false;
        }
    }
    for (int i = 0; i < 7; ++i) {
        criteria[i] = new CriteriaEvaluator(cachetables::criteriaTexts[i]);
        if (!criteria[i]->setVariables(defaultVariables)) {
            FS_TRACE(log, MIN, "criteriaEvaluator creation error!");
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

// ------------------------------------------------------------------ lookups

bool FS_CacheBase::lookUp(RecordSet& set, int criterion, wchar_t const* column, int variable,
                          unsigned int number, wchar_t const* text, bool caseSensitive)
{
    CriteriaEvaluator* evaluator = criteria[criterion];
    Field* handle = variableHandles[variable];
    if (evaluator == nullptr || handle == nullptr || set.isEmpty())
        return false;
    hashValue.clear();
    hashValue.setNValueString(column);
    if (text != nullptr) {
        hashValue.setString(text);
        static_cast<TextField*>(handle)->value(text);
    } else {
        hashValue.setNumericValue(number);
        static_cast<Int32Field*>(handle)->value(number);
    }
    evaluator->setHashInfo(hashValue);
    set.setCriteria(evaluator, caseSensitive);
    // The criteria that compare one INT32 column with one INT32 variable are
    // decided by the cursor itself, without the evaluator, for each
    // candidate of the hash chain (a directory's path is rebuilt through
    // these, one lookup per component).
    for (cachetables::Int32Equality const& e : cachetables::int32Equalities) {
        if (e.criterion != criterion) continue;
        int at = set.get()->getRecord()->indexOf(e.column);
        if (at >= 0) set.get()->compareInt32(static_cast<unsigned int>(at), variableHandles[e.variable]);
    }
    return set.moveFirst();
}

bool FS_CacheBase::findPathByName(RecordSet& first, RecordSet& second, wchar_t* path,
                                  bool caseSensitive)
{
    if (path == nullptr)
        return false;
    PathHelper helper(1);
    std::vector<PathInfo> prefixes;
    std::vector<PathInfo> names;
    helper.pathReducer(PathInfo(path, true), prefixes, names);
    if (names.empty() || names[0].getPathName() == nullptr)
        return false;
    size_t last = names.size() - 1;

    for (bool row = lookUp(first, cachetables::CRIT_PATH_NAME, L"PATHNAME",
                           cachetables::VAR_PATHNAME, 0, names[0].getPathName(), caseSensitive);
         row; row = first.moveNext()) {
        unsigned int parent = first.getFieldAsInt32(L"PARENTID");
        if (last == 0) {
            if (parent == 0)
                return true;
            continue;
        }
        // Walk up the chain; the topmost component must sit at the top.
        unsigned int current = parent;
        for (size_t k = 1; k <= last; ++k) {
            if (!lookUp(second, cachetables::CRIT_ID, L"ID", cachetables::VAR_ID, current,
                        nullptr, true))
                break;
            wchar_t const* component = second.getFieldAsString(L"PATHNAME");
            wchar_t const* wanted = names[k].getPathName();
            if (component == nullptr || wanted == nullptr ||
                wcsvccmp(wanted, component, caseSensitive) != 0)
                break;
            unsigned int upper = second.getFieldAsInt32(L"PARENTID");
            if (k == last) {
                if (upper == 0)
                    return true;
                break;
            }
            current = upper;
        }
    }
    return false;
}

namespace {

// Empties memo but for the entries of the chain that starts at id and climbs
// through the parents it holds; the texts of the others are released.
void keepMemoChain(std::map<int, MapItem>& memo, unsigned int id)
{
    std::map<int, MapItem> chain;
    // Each step moves an entry out, so even a damaged cycle of parents ends.
    for (unsigned int current = id; current != 0;) {
        std::map<int, MapItem>::iterator it = memo.find(static_cast<int>(current));
        if (it == memo.end())
            break;
        current = it->second.parentId;
        chain.insert(*it);
        memo.erase(it);
    }
    for (std::map<int, MapItem>::iterator it = memo.begin(); it != memo.end(); ++it)
        kelm_free(it->second.text);
    memo.swap(chain);
}

}  // namespace

void FS_CacheBase::clearPathMemo()
{
    for (std::map<int, MapItem>::iterator it = pathMemo.begin(); it != pathMemo.end(); ++it)
        kelm_free(it->second.text);
    pathMemo.clear();
    ++pathMemoEdits;
}

bool FS_CacheBase::findPathById(RecordSet& directories, unsigned int id, wchar_t* buffer,
                                unsigned int size)
{
    return findPathByIdAlong(directories, id, buffer, size, nullptr);
}

bool FS_CacheBase::findPathByIdAlong(RecordSet& directories, unsigned int id, wchar_t* buffer,
                                     unsigned int size, PathChain* chain)
{
    if (buffer == nullptr || size == 0)
        return false;
    buffer[0] = L'\0';
    // The path grows from the leaf up, so it is built at the end of the
    // buffer, each component in front of the last, and moved to the start
    // once.  A component fits as long as the path stays 4 characters short
    // of size.
    size_t length = 0;
    size_t start = size - 1;
    buffer[start] = L'\0';
    auto prepend = [&](wchar_t const* text, size_t n) -> bool {
        if (n + length + 4 > size)
            return false;
        start -= n;
        wmemcpy(buffer + start, text, n);
        length += n;
        return true;
    };
    const wchar_t separator = PathHelper::PathSeparator;
    // The last walk answers only while every memo entry it came from is
    // still there; an entry dropped during this walk spoils this one too.
    const size_t editsBefore = pathMemoEdits;
    bool chainHolds = chain != nullptr && chain->valid && chain->edits == pathMemoEdits;
    size_t kept = 0;  // steps of the last walk this one ends on
    if (chain != nullptr)
        chain->fresh.clear();
    unsigned int current = id;
    while (current != 0) {
        if (chainHolds) {
            size_t k = chain->steps.size();
            while (k > 0 && chain->steps[k - 1].id != current)
                --k;
            if (k > 0) {
                // From here up the memo holds every id of the last walk, and
                // the walk would prepend their components one by one; each
                // prepend is refused only where the whole would be.
                const PathChain::Step& met = chain->steps[k - 1];
                bool failed = length != 0 && met.separatorAfter && !prepend(&separator, 1);
                if (!failed)
                    failed = !prepend(chain->text.data(), met.end);
                if (failed) {
                    buffer[0] = L'\0';
                    chain->valid = false;
                    return false;
                }
                kept = k;
                break;
            }
        }
        bool failed = false;
        wchar_t* component = nullptr;
        unsigned int parent = 0;
        std::map<int, MapItem>::iterator hit = pathMemo.find(static_cast<int>(current));
        if (hit != pathMemo.end()) {
            component = hit->second.text;
            parent = hit->second.parentId;
        } else if (!lookUp(directories, cachetables::CRIT_ID, L"ID", cachetables::VAR_ID, current,
                           nullptr, true)) {
            failed = true;
        } else {
            wchar_t const* name = directories.getFieldAsString(L"PATHNAME");
            parent = directories.getFieldAsInt32(L"PARENTID");
            // Past its bound the memo keeps only the chain above this row,
            // which the walk is about to climb: rows arrive grouped by
            // directory and directories in the order of the scan, so the
            // ancestors are what the next rows need again.
            if (pathMemo.size() > cachetables::MEMO_ENTRIES) {
                keepMemoChain(pathMemo, parent);
                ++pathMemoEdits;
            }
            // A component longer than the limit is cut; the prepend below
            // then refuses the path as too long for any buffer.
            size_t room = cachetables::MEMO_TEXT_BYTES / sizeof(wchar_t) - 1;
            size_t n = name != nullptr ? wcslen(name) : 0;
            if (n > room)
                n = room;
            // The block is as long as the name: the memo's memory follows
            // the names, and a flush returns small blocks that the next
            // directories reuse.
            component = static_cast<wchar_t*>(kelm_malloc((n + 1) * sizeof(wchar_t)));
            if (component != nullptr) {
                if (n != 0)
                    wmemcpy(component, name, n);
                component[n] = L'\0';
                MapItem item;
                item.text = component;
                item.parentId = parent;
                int key = static_cast<int>(directories.getFieldAsInt32(L"ID"));
                std::map<int, MapItem>::iterator old = pathMemo.find(key);
                if (old != pathMemo.end()) {
                    kelm_free(old->second.text);
                    pathMemo.erase(old);
                    ++pathMemoEdits;
                }
                pathMemo[key] = item;
            }
        }
        if (pathMemoEdits != editsBefore)
            chainHolds = false;
        if (!failed && component == nullptr)
            failed = true;
        if (!failed) {
            size_t n = wcslen(component);
            bool separatorAfter = n == 0 || component[n - 1] != PathHelper::PathSeparator;
            if (length != 0 && separatorAfter)
                failed = !prepend(&separator, 1);
            if (!failed)
                failed = !prepend(component, n);
            if (!failed && chain != nullptr)
                chain->fresh.push_back(PathChain::Step{current, start + n, separatorAfter});
        }
        if (failed) {
            // current is never 0 inside the loop: a broken walk is a failure.
            buffer[0] = L'\0';
            if (chain != nullptr)
                chain->valid = false;
            return false;
        }
        current = parent;
    }
    wmemmove(buffer, buffer + start, length + 1);
    if (chain != nullptr) {
        // This walk for the next: the steps it met of the last one, then its
        // own, root first, each ending where its component ends now.
        if (pathMemoEdits != editsBefore) {
            chain->valid = false;
        } else {
            chain->steps.resize(kept);
            for (size_t i = chain->fresh.size(); i-- > 0;) {
                PathChain::Step step = chain->fresh[i];
                step.end -= start;
                chain->steps.push_back(step);
            }
            chain->text.assign(buffer, length);
            chain->edits = pathMemoEdits;
            chain->valid = true;
        }
    }
    return length != 0;
}

void FS_CacheBase::removeFiles(FS_Table* files, unsigned int pathId)
{
    if (files == nullptr)
        return;
    RecordSet set = files->openRecordSet();
    for (bool row = lookUp(set, cachetables::CRIT_PATH_ID, L"PATHID", cachetables::VAR_PATHID,
                           pathId, nullptr, true);
         row; row = set.moveNext())
        set.remove();
    if (!files->closeRecordSet(set))
        FS_TRACE(log, MIN, "closeRecordSet failed!");
}

void FS_CacheBase::removeTree(FS_Table* directories, FS_Table* files, unsigned int id)
{
    if (directories == nullptr)
        return;
    // Ids of removed rows must not be answered from the memo any more.
    clearPathMemo();
    RecordSet set = directories->openRecordSet();
    for (bool row = lookUp(set, cachetables::CRIT_PARENT_ID, L"PARENTID",
                           cachetables::VAR_PARENTID, id, nullptr, true);
         row;) {
        removeTree(directories, files, set.getFieldAsInt32(L"ID"));
        // The recursion wrote its own id into the shared variable.
        static_cast<Int32Field*>(variableHandles[cachetables::VAR_PARENTID])->value(id);
        row = set.moveNext();
    }
    removeFiles(files, id);
    if (lookUp(set, cachetables::CRIT_ID, L"ID", cachetables::VAR_ID, id, nullptr, true))
        set.remove();
    if (!directories->closeRecordSet(set))
        FS_TRACE(log, MIN, "closeRecordSet failed!");
}

// ----------------------------------------------------------- query functions

int chPathCommand::execute(ExpValue const& left, ExpValue const& right, ExpValue& result)
{
    QvLogWrapper* log = getQvLogFs();
    wchar_t const* name = right.getStringValue();
    if (name == nullptr || name[0] == L'\0' || cache == nullptr ||
        cache->tbDirectories == nullptr) {
        log->traceMIN(__LINE__, __FILE__, __func__, "chPathCommand::execute - args not valid!");
        return 1;
    }
    // The cursor stays with the table, which deletes it when it closes.
    RecordSet directories = cache->tbDirectories->openRecordSet();
    std::vector<wchar_t> buffer(cachetables::PATH_CHARS);
    if (!cache->findPathById(directories, static_cast<unsigned int>(left.getNumber()),
                             buffer.data(), cachetables::PATH_CHARS)) {
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "chPathCommand::execute - findPathById(...) failed!");
        return 1;
    }
    wchar_t* full = getFullPathName(buffer.data(), name);
    if (full == nullptr) {
        log->traceMIN(__LINE__, __FILE__, __func__,
                      "chPathCommand::execute - getFullPathName(...) failed!");
        return 1;
    }
    result.setString(full);
    kelm_free(full);
    return 0;
}

int chTypeCommand::execute(ExpValue const& left, ExpValue const& right, ExpValue& result)
{
    QvLogWrapper* log = getQvLogFs();
    wchar_t const* path = left.getStringValue();
    wchar_t const* wanted = right.getStringValue();
    if (!left.isString() || !right.isString() || path == nullptr || wanted == nullptr ||
        path[0] == L'\0' || wanted[0] == L'\0') {
        log->traceMIN(__LINE__, __FILE__, __func__, "chTypeCommand::execute - args not valid!\n");
        return 1;
    }
    StringList<wchar_t> types;
    types.insert(wanted);
    int retValue = checker.check(path, types) ? 1 : 0;
    result.setNumericValue(static_cast<unsigned long long>(retValue));
    log->traceMAX(__LINE__, __FILE__, __func__, "chTypeCommand::execute - exit. [retValue is %d]\n",
                  retValue);
    return 0;
}
