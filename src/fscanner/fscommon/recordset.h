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

class __recordSet {
public:
    // An empty cursor: read, insert, update and remove give false.
    __recordSet();
    // A cursor on table, with a copy of its schema as the record buffer.
    explicit __recordSet(FS_Table* table);
    // Frees the key and deletes the buffer.
    ~__recordSet();

    bool moveFirst();
    bool moveNext();
    bool movePrevious();
    // Always false (see the .cpp): the table's own moveLast reports failure.
    bool moveLast();

    bool read();
    bool insert();
    bool update();
    bool remove();

    // Number of live records minus one (0 for an empty table too).
    unsigned int count();
    int lock(int timeout);
    int unlock();

    // Field access by name or position.  A column the buffer lacks, or holds
    // with another type than the call's, fails the call: getters give 0 or
    // null, setters store nothing.
    unsigned char getFieldAsInt8(wchar_t const* name);
    unsigned char getFieldAsInt8(unsigned int index);
    unsigned short getFieldAsInt16(wchar_t const* name);
    unsigned short getFieldAsInt16(unsigned int index);
    unsigned int getFieldAsInt32(wchar_t const* name);
    unsigned int getFieldAsInt32(unsigned int index);
    unsigned long long getFieldAsInt64(wchar_t const* name);
    unsigned long long getFieldAsInt64(unsigned int index);
    wchar_t const* getFieldAsString(wchar_t const* name);
    wchar_t const* getFieldAsString(unsigned int index);
    unsigned char const* getFieldAsHex(wchar_t const* name);
    unsigned char const* getFieldAsHex(unsigned int index);

    void setFieldAsInt8(wchar_t const* name, unsigned char value);
    void setFieldAsInt8(unsigned int index, unsigned char value);
    void setFieldAsInt16(wchar_t const* name, unsigned short value);
    void setFieldAsInt16(unsigned int index, unsigned short value);
    void setFieldAsInt32(wchar_t const* name, unsigned int value);
    void setFieldAsInt32(unsigned int index, unsigned int value);
    void setFieldAsInt64(wchar_t const* name, unsigned long long value);
    void setFieldAsInt64(unsigned int index, unsigned long long value);
    void setFieldAsString(wchar_t const* name, wchar_t const* value);
    void setFieldAsString(unsigned int index, wchar_t const* value);
    void setFieldAsHex(wchar_t const* name, unsigned char const* value);
    void setFieldAsHex(unsigned int index, unsigned char const* value);

    // Binds evaluator (not owned) to the record buffer and, where it names an
    // indexed column with a fixed value, switches to index navigation.  A null
    // evaluator, or one without criteria text, ends filtering.  Always true.
    bool setCriteria(CriteriaEvaluator* evaluator, bool caseSensitive);

    // Traces every field of the buffer at the most detailed level.
    void printFields();

    // For inspection by tests.
    unsigned int getId() const { return id; }
    unsigned int getPosition() const { return position; }
    Fields* getRecord() const { return record; }
    bool isIndexNavigation() const { return index != nullptr && key != nullptr; }

private:
    __recordSet(const __recordSet&) = delete;
    __recordSet& operator=(const __recordSet&) = delete;

    void forgetIndex();
    bool fits();
    // Reads the record at id into the buffer and decides it, or, with a name
    // filter, decides from the stored name alone a record that can not fit
    // (the buffer is then left as it was).  False when the read fails.
    bool readAndDecide(bool* accepted);

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
};

class RecordSet {
public:
    RecordSet() : rs(nullptr) {}
    explicit RecordSet(__recordSet* inner) : rs(inner) {}

    bool moveFirst();
    bool moveNext();
    bool movePrevious();
    bool moveLast();

    bool read();
    bool insert();
    bool update();
    bool remove();

    unsigned int count();
    int lock(int timeout);
    int unlock();

    unsigned char getFieldAsInt8(wchar_t const* name);
    unsigned char getFieldAsInt8(unsigned int index);
    unsigned short getFieldAsInt16(wchar_t const* name);
    unsigned short getFieldAsInt16(unsigned int index);
    unsigned int getFieldAsInt32(wchar_t const* name);
    unsigned int getFieldAsInt32(unsigned int index);
    unsigned long long getFieldAsInt64(wchar_t const* name);
    unsigned long long getFieldAsInt64(unsigned int index);
    wchar_t const* getFieldAsString(wchar_t const* name);
    wchar_t const* getFieldAsString(unsigned int index);
    unsigned char const* getFieldAsHex(wchar_t const* name);
    unsigned char const* getFieldAsHex(unsigned int index);

    void setFieldAsInt8(wchar_t const* name, unsigned char value);
    void setFieldAsInt8(unsigned int index, unsigned char value);
    void setFieldAsInt16(wchar_t const* name, unsigned short value);
    void setFieldAsInt16(unsigned int index, unsigned short value);
    void setFieldAsInt32(wchar_t const* name, unsigned int value);
    void setFieldAsInt32(unsigned int index, unsigned int value);
    void setFieldAsInt64(wchar_t const* name, unsigned long long value);
    void setFieldAsInt64(unsigned int index, unsigned long long value);
    void setFieldAsString(wchar_t const* name, wchar_t const* value);
    void setFieldAsString(unsigned int index, wchar_t const* value);
    void setFieldAsHex(wchar_t const* name, unsigned char const* value);
    void setFieldAsHex(unsigned int index, unsigned char const* value);

    bool setCriteria(CriteriaEvaluator* evaluator, bool caseSensitive);
    void printFields();

    __recordSet* get() const { return rs; }
    bool isEmpty() const { return rs == nullptr; }
    void clear() { rs = nullptr; }

private:
    __recordSet* rs;
};

#endif
