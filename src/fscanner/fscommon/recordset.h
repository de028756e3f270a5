#ifndef FSCANNER_FSCOMMON_RECORDSET_H
#define FSCANNER_FSCOMMON_RECORDSET_H

// Cursors over an FS_Table.
//
// __recordSet is the cursor: it owns a copy of the table's schema as its
// record buffer.  Moves read the current record into that buffer, getters and
// setters work on it, and insert/update store it.  With criteria set, only the
// records the evaluator accepts are shown; when the criteria name an indexed
// column with a fixed value, the cursor follows that column's hash chain
// instead of walking the whole table (the evaluator still decides every
// match, since a chain also holds collisions).
//
// RecordSet is a thin handle on a __recordSet.  The table owns the cursor:
// FS_Table::close, closeRecordSet and the table's destructor delete it, so a
// handle never outlives its table.  Neither class locks; a cursor serves one
// thread at a time.

#include "fscanner/fscommon/table.h"

class Fields;
class Index;
class CriteriaEvaluator;
class NameMaskFilter;

// ---- the cursor operations, stated once for both classes -------------------
//
// RecordSet offers exactly the operations of __recordSet and forwards each to
// its cursor; these lists declare them in both.  On the cursor:
//
//   moveFirst, moveNext, movePrevious: position and read the record.  moveLast
//     is always false (see the .cpp): the table's own moveLast reports failure.
//   read, insert, update, remove: the current record and the buffer.
//   count: number of live records minus one (0 for an empty table too).
//   lock(timeout), unlock: the table's lock.
//   getFieldAs..., setFieldAs...: field access by name or position.  A column
//     the buffer lacks, or holds with another type than the call's, fails the
//     call: getters give 0 or null, setters store nothing.
//   setCriteria: binds evaluator (not owned) to the record buffer and, where it
//     names an indexed column with a fixed value, switches to index
//     navigation.  A null evaluator, or one without criteria text, ends
//     filtering.  Always true.
//   printFields: traces every field of the buffer at the most detailed level.
//
// The handle's operations on an empty handle do nothing and give false, 0,
// null or SYNC_FAILED.

// One row a column type: the suffix of its getFieldAs/setFieldAs pair, the
// value type, the field class and its type number.
#define FSCANNER_RECORDSET_FIELD_TYPES(X)                 \
    X(Int8, unsigned char, Int8Field, FIELD_INT8)         \
    X(Int16, unsigned short, Int16Field, FIELD_INT16)     \
    X(Int32, unsigned int, Int32Field, FIELD_INT32)       \
    X(Int64, unsigned long long, Int64Field, FIELD_INT64) \
    X(String, wchar_t const*, TextField, FIELD_TEXT)      \
    X(Hex, unsigned char const*, HexField, FIELD_HEX)

#define FSCANNER_RECORDSET_DECLARE_FIELD_ACCESS(Suffix, Value, FieldClass, TypeNumber) \
    Value getFieldAs##Suffix(wchar_t const* name);                                   \
    Value getFieldAs##Suffix(unsigned int index);                                    \
    void setFieldAs##Suffix(wchar_t const* name, Value value);                       \
    void setFieldAs##Suffix(unsigned int index, Value value);

#define FSCANNER_RECORDSET_OPERATIONS                                        \
    bool moveFirst();                                                        \
    bool moveNext();                                                         \
    bool movePrevious();                                                     \
    bool moveLast();                                                         \
                                                                             \
    bool read();                                                             \
    bool insert();                                                           \
    bool update();                                                           \
    bool remove();                                                           \
                                                                             \
    unsigned int count();                                                    \
    int lock(int timeout);                                                   \
    int unlock();                                                            \
                                                                             \
    FSCANNER_RECORDSET_FIELD_TYPES(FSCANNER_RECORDSET_DECLARE_FIELD_ACCESS)  \
                                                                             \
    bool setCriteria(CriteriaEvaluator* evaluator, bool caseSensitive);      \
    void printFields();

class __recordSet {
public:
    // An empty cursor: read, insert, update and remove give false.
    __recordSet();
    // A cursor on table, with a copy of its schema as the record buffer.
    explicit __recordSet(FS_Table* table);
    // Frees the key and deletes the buffer.
    ~__recordSet();

    FSCANNER_RECORDSET_OPERATIONS

    // For inspection by tests.
    unsigned int getId() const { return id; }
    unsigned int getPosition() const { return position; }
    Fields* getRecord() const { return record; }
    bool isIndexNavigation() const { return index != nullptr && key != nullptr; }
    // For criteria set by the last setCriteria that are exactly one
    // comparison "[column]==variable" of an INT32 column of the record with
    // an INT32 variable: the cursor decides each record by comparing the two
    // values instead of running the evaluator, which decides them the same
    // way.  Until the next setCriteria.  False, and nothing changes, without
    // criteria or when a type is not INT32.
    bool compareInt32(unsigned int column, Field* variable);

private:
    __recordSet(const __recordSet&) = delete;
    __recordSet& operator=(const __recordSet&) = delete;

    void forgetIndex();
    bool fits();
    // Reads the record at id into the buffer and decides it, or, with a name
    // filter, decides from the stored name alone a record that can not fit
    // (the buffer is then left as it was).  False when the read fails.
    bool readAndDecide(bool* accepted);
    // moveNext of the walk, past the rows the name filter turns away.
    bool moveToCandidate();
    static bool rejectsName(void* context, const unsigned char* bytes, uint32_t length);

    unsigned int id;
    unsigned int position;
    FS_Table* table;
    RecordHeader header;
    Fields* record;
    wchar_t* key;
    unsigned int nextSlot;
    Index* index;
    bool caseFlag;
    bool hasCriteria;
    CriteriaEvaluator* evaluator;
    // The evaluator's byte test of the stored names, for walks over the
    // whole table; null when it has none.  Owned by the evaluator.
    NameMaskFilter const* nameFilter;
    // Set by compareInt32: the column (-1 for none) and the variable it is
    // compared with.  The variable is not owned.
    int equalColumn;
    Field* equalVariable;
    // The row moveToCandidate stands on passed the name filter's checks in
    // the table: readAndDecide reads it without peeking again.
    bool nameWanted;
};

class RecordSet {
public:
    RecordSet() : rs(nullptr) {}
    explicit RecordSet(__recordSet* inner) : rs(inner) {}

    FSCANNER_RECORDSET_OPERATIONS

    __recordSet* get() const { return rs; }
    bool isEmpty() const { return rs == nullptr; }
    void clear() { rs = nullptr; }

private:
    __recordSet* rs;
};

#endif
