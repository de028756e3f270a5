// Schema of the cache's two tables.
//
// Directories table, columns in order: "ID" (Int32, id from 1), "PATHNAME"
// (Text, one path component; "/" for a tree's first row), "PARENTID" (Int32,
// 0 at the top), "CREATIONTIME" (Int32, epoch seconds of the last scan, 0 for
// a row that only carries a path).  Hash indexes <table>_PATHNAME, <table>_ID,
// <table>_PARENTID, in that order.
//
// Files table, columns in order: "FILENAME" (Text), "ATTR" (Int32), "SIZE"
// (Int64), "PATHID" (Int32, the directory's ID), "MD5" (Text, "0" when not
// computed), "CRC32" (Int32), "Q32" (Int32).  Hash indexes <table>_FILENAME,
// <table>_PATHID.
#ifndef FSCANNER_FSCOMMON_CACHETABLES_H
#define FSCANNER_FSCOMMON_CACHETABLES_H

#include <string>

#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filetypehelper.h"

class FS_CacheBase;
class FS_Table;

namespace cachetables {
// The column types of the schema, as the table's fields name them.
const unsigned int TYPE_INT32 = FIELD_INT32;
const unsigned int TYPE_INT64 = FIELD_INT64;
const unsigned int TYPE_TEXT = FIELD_TEXT;
const unsigned int DIRECTORY_COLUMNS = 4;
const unsigned int FILE_COLUMNS = 7;
extern wchar_t const* const directoryColumns[DIRECTORY_COLUMNS];
extern unsigned int const directoryTypes[DIRECTORY_COLUMNS];
extern wchar_t const* const directoryIndexes[3];
extern wchar_t const* const fileColumns[FILE_COLUMNS];
extern unsigned int const fileTypes[FILE_COLUMNS];
extern wchar_t const* const fileIndexes[2];
// The shared lookup variables, in order, and their types.
extern wchar_t const* const variableNames[10];
extern unsigned int const variableTypes[10];
// The prepared criteria, in order.
extern wchar_t const* const criteriaTexts[7];
// Indexes of the prepared criteria and of the lookup variables.
enum Criterion { CRIT_PATH_ID, CRIT_PARENT_ID, CRIT_ID, CRIT_PATH_OR_SHORT_PATH, CRIT_PATH_NAME,
                 CRIT_FILE_OR_SHORT_FILE, CRIT_FILE_NAME };
enum Variable { VAR_ID, VAR_PATHID, VAR_PARENTID, VAR_PATHNAME, VAR_SHORTPATHNAME, VAR_FILENAME,
                VAR_SHORTFILENAME, VAR_MD5, VAR_CRC32, VAR_Q32 };
// A prepared criterion that is one comparison of an INT32 column with an
// INT32 variable, which the cursor decides without the evaluator.
struct Int32Equality {
    Criterion criterion;
    wchar_t const* column;
    Variable variable;
};
extern Int32Equality const int32Equalities[3];
// Longest path, in wide characters, that the lookups rebuild.
const unsigned int PATH_CHARS = 4096;
// Longest memo text in bytes, terminator included; a longer name is cut.
// Each text takes a block of its own length.
const unsigned int MEMO_TEXT_BYTES = 0x4004;
// Once the memo holds more entries than this, a lookup that adds one first
// drops all but the chain of parents above the new entry.
const unsigned int MEMO_ENTRIES = 32;

// Checks the two tables of a cache opened from disk before they serve, in
// time independent of their size: each has exactly the schema above and only
// the indexes above (one may be missing: the table then walks),
// FS_Table::verify passes and arms the tables' guards, and the directories
// table holds no more rows than the counter has given ids.  It also gives
// the directories table a row check: every directory row read has an id from
// 1 to *counter and a parent of at most *counter (the existence of that
// parent is checked where the path is rebuilt).  counter must stay valid
// while the tables are open.  True when all holds; otherwise false with the
// file and the check of the first failure in *file and *check.
bool checkCacheTables(FS_Table* directories, FS_Table* files, unsigned int const* counter,
                      std::wstring* file, char const** check);
}  // namespace cachetables

// The query function path(directory id, file name) over cache rows: the full
// path of the file, rebuilt from the directories table of cache.
class chPathCommand : public BinaryCmd {
public:
    explicit chPathCommand(FS_CacheBase* cache) : cache(cache) {}
    int execute(ExpValue const& left, ExpValue const& right, ExpValue& result) override;

private:
    FS_CacheBase* cache;
};

// The query function type(path, wanted words): 1 when the file's type
// description holds one of the words, else 0.
class chTypeCommand : public BinaryCmd {
public:
    int execute(ExpValue const& left, ExpValue const& right, ExpValue& result) override;

private:
    FileTypeChecker checker;
};

#endif
