#include "fscanner/fscommon/recordset.h"

#include <cstring>
#include <cwchar>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sync.h"

// ---- __recordSet ---------------------------------------------------------------

namespace {

Field* lookup(Fields* record, wchar_t const* name) { return record->name(name); }
Field* lookup(Fields* record, unsigned int i) { return i < record->count() ? record->at(i) : nullptr; }

// The column the caller names, when the buffer has it with the type the
// caller expects; null otherwise.  The schema comes from the table file's
// header, so a damaged header must fail the call instead of the process:
// getters then answer 0 or null and setters store nothing.
template <class F, class Key>
F* column(Fields* record, Key key, unsigned int type) {
    Field* f = lookup(record, key);
    return (f != nullptr && f->getType() == type) ? static_cast<F*>(f) : nullptr;
}

}  // namespace

__recordSet::__recordSet()
    : id(0),
      position(0),
      table(nullptr),
      header(),
      record(new Fields()),
      key(nullptr),
      nextSlot(0),
      index(nullptr),
      caseFlag(false),
      hasCriteria(false),
      evaluator(nullptr),
      nameFilter(nullptr),
      equalColumn(-1),
      equalVariable(nullptr),
      nameWanted(false) {}

__recordSet::__recordSet(FS_Table* owner)
    : id(0),
      position(0),
      table(owner),
      header(),
      record(owner != nullptr ? new Fields(owner->getFields()) : new Fields()),
      key(nullptr),
      nextSlot(0),
      index(nullptr),
      caseFlag(false),
      hasCriteria(false),
      evaluator(nullptr),
      nameFilter(nullptr),
      equalColumn(-1),
      equalVariable(nullptr),
      nameWanted(false) {}

__recordSet::~__recordSet() {
    kelm_free(key);
    key = nullptr;
    delete record;
    record = nullptr;
}

void __recordSet::forgetIndex() {
    index = nullptr;
    kelm_free(key);
    key = nullptr;
}

bool __recordSet::setCriteria(CriteriaEvaluator* criteria, bool caseSensitive) {
    forgetIndex();
    nameFilter = nullptr;
    nameWanted = false;
    equalColumn = -1;
    equalVariable = nullptr;
    evaluator = criteria;
    if (criteria == nullptr || criteria->getCriteria() == nullptr || criteria->getCriteria()[0] == L'\0') {
        hasCriteria = false;
        caseFlag = caseSensitive;
        return true;
    }
    criteria->setFields(record);
    ExpValue* info = criteria->getHashInfo();
    // An evaluator keeps an empty description when no comparison fits.
    if (info != nullptr && info->hasName() && table != nullptr) {
        Index* found = table->searchHashIndexForFieldName(info->getNValueString(), false);
        if (found != nullptr) {
            if (info->getType() == EXP_NUMERIC) {
                key = static_cast<wchar_t*>(kelm_malloc(128));
                if (key != nullptr) wcs_itoa(static_cast<unsigned int>(info->getNumber()), key);
            } else if (info->getType() == EXP_STRING) {
                key = wideDuplicate(info->getStringValue());
            }
            if (key != nullptr) {
                wcsupper(key);
                index = found;
            }
        }
    }
    hasCriteria = true;
    caseFlag = caseSensitive;
    // A hash chain is short; the byte test pays on walks over the table.
    if (index == nullptr && table != nullptr) nameFilter = criteria->getNameFilter(record);
    return true;
}

// A record fits when no criteria are set or the criteria accept it.  Every
// candidate is decided, also those of a hash chain, which holds collisions
// and stale entries.  The evaluator decides, except for criteria that are
// one comparison of an INT32 column with an INT32 variable (compareInt32):
// the evaluator turns both sides into numbers the same way, so they are
// equal exactly when the two 32-bit values are, and the cursor compares
// them itself.  A null side still goes to the evaluator.
bool __recordSet::fits() {
    if (!hasCriteria) return true;
    if (equalColumn >= 0) {
        Field* field = record->at(static_cast<unsigned int>(equalColumn));
        if (!field->isNull() && !equalVariable->isNull())
            return static_cast<Int32Field*>(field)->value() == static_cast<Int32Field*>(equalVariable)->value();
    }
    return evaluator->check(record, nullptr, caseFlag) > 0;
}

bool __recordSet::compareInt32(unsigned int column, Field* variable) {
    if (!hasCriteria || record == nullptr || column >= record->count() || variable == nullptr) return false;
    if (record->at(column)->getType() != FIELD_INT32 || variable->getType() != FIELD_INT32) return false;
    equalColumn = static_cast<int>(column);
    equalVariable = variable;
    return true;
}

bool __recordSet::rejectsName(void* context, const unsigned char* bytes, uint32_t length) {
    __recordSet* self = static_cast<__recordSet*>(context);
    return !self->nameFilter->mayMatchAscii(bytes, length, self->caseFlag);
}

bool __recordSet::moveToCandidate() {
    // Rows whose name the byte test turns away are passed over in the
    // table; the next one is read here, without a second look at its name
    // when the table has just found it wanted.
    unsigned int wanted = FS_Table::kNoRow;
    if (nameFilter != nullptr) table->skipRejected(id, nameFilter->getColumn(), rejectsName, this, &wanted);
    if (!table->moveNext(id)) return false;
    nameWanted = wanted != FS_Table::kNoRow && id == wanted;
    return true;
}

bool __recordSet::readAndDecide(bool* accepted) {
    // wanted: the name is plain ASCII and the byte test let it through.
    bool wanted = nameWanted;
    nameWanted = false;
    if (nameFilter != nullptr && !wanted) {
        const unsigned char* text = nullptr;
        uint32_t length = 0;
        bool ascii = false;
        if (table->peekText(id, nameFilter->getColumn(), &text, &length, &ascii) && ascii) {
            if (!nameFilter->mayMatchAscii(text, length, caseFlag)) {
                *accepted = false;
                return true;
            }
            wanted = true;
        }
    }
    if (!read()) return false;
    // Criteria that are the one mask comparison were decided by the byte
    // test on that name: the row is read for its values, not evaluated again.
    *accepted = (wanted && nameFilter->decidesAscii()) || fits();
    return true;
}

bool __recordSet::moveFirst() {
    if (table == nullptr) return false;
    if (isIndexNavigation()) {
        if (!table->hashIndex_moveFirst(*index, key, id, nextSlot)) return false;
        for (;;) {
            if (!read()) return false;
            if (fits()) {
                position = 0;
                return true;
            }
            if (!table->hashIndex_moveNext(*index, id, nextSlot)) return false;
        }
    }
    nameWanted = false;
    if (!table->moveFirst(id)) return false;
    for (;;) {
        bool accepted = false;
        if (!readAndDecide(&accepted)) return false;
        if (accepted) {
            position = 0;
            return true;
        }
        if (!moveToCandidate()) return false;
    }
}

bool __recordSet::moveNext() {
    if (table == nullptr) return false;
    if (isIndexNavigation()) {
        for (;;) {
            if (!table->hashIndex_moveNext(*index, id, nextSlot)) return false;
            if (!read()) return false;
            if (fits()) {
                ++position;
                return true;
            }
        }
    }
    for (;;) {
        if (!moveToCandidate()) return false;
        bool accepted = false;
        if (!readAndDecide(&accepted)) return false;
        if (accepted) {
            ++position;
            return true;
        }
    }
}

bool __recordSet::movePrevious() {
    // Hash chains only run forward.
    if (table == nullptr || isIndexNavigation()) return false;
    for (;;) {
        if (!table->movePrevious(id)) return false;
        if (!read()) return false;
        if (fits()) {
            --position;
            return true;
        }
    }
}

bool __recordSet::moveLast() {
    if (table == nullptr || isIndexNavigation()) return false;
    // The table's moveLast answers 0 even when it found the last record, so
    // this cursor reports failure and reads nothing, while number and position
    // already name the last live record (both stay as they were on an empty
    // table).  Callers that want that record call read().
    if (!table->moveLast(id, position)) return false;
    for (;;) {
        if (!read()) return false;
        if (fits()) return true;
        if (!table->movePrevious(id)) return false;
        --position;
    }
}

bool __recordSet::read() { return table != nullptr && table->read(id, *record); }
bool __recordSet::insert() { return table != nullptr && table->insert(*record); }
bool __recordSet::update() { return table != nullptr && table->update(id, *record); }
bool __recordSet::remove() { return table != nullptr && table->remove(id); }

unsigned int __recordSet::count() {
    if (table == nullptr) return 0;
    unsigned int last = 0;
    unsigned int live = 0;
    table->moveLast(last, live);
    return live;
}

int __recordSet::lock(int timeout) {
    if (table == nullptr) return SYNC_FAILED;
    return table->lock(static_cast<long>(timeout));
}

int __recordSet::unlock() {
    if (table == nullptr) return SYNC_FAILED;
    table->unlock();
    return 0;
}

// Each column type's getters and setters: the column by name or position,
// when the buffer has it with that type (see column above).
#define FSCANNER_CURSOR_FIELD_ACCESS(Suffix, Value, FieldClass, TypeNumber)     \
    Value __recordSet::getFieldAs##Suffix(wchar_t const* name) {                \
        FieldClass* f = column<FieldClass>(record, name, TypeNumber);           \
        return f != nullptr ? f->value() : static_cast<Value>(0);               \
    }                                                                           \
    Value __recordSet::getFieldAs##Suffix(unsigned int i) {                     \
        FieldClass* f = column<FieldClass>(record, i, TypeNumber);              \
        return f != nullptr ? f->value() : static_cast<Value>(0);               \
    }                                                                           \
    void __recordSet::setFieldAs##Suffix(wchar_t const* name, Value v) {        \
        if (FieldClass* f = column<FieldClass>(record, name, TypeNumber)) f->value(v); \
    }                                                                           \
    void __recordSet::setFieldAs##Suffix(unsigned int i, Value v) {             \
        if (FieldClass* f = column<FieldClass>(record, i, TypeNumber)) f->value(v); \
    }

FSCANNER_RECORDSET_FIELD_TYPES(FSCANNER_CURSOR_FIELD_ACCESS)

#undef FSCANNER_CURSOR_FIELD_ACCESS

void __recordSet::printFields() {
    QvLogWrapper* log = getQvLogFs();
    for (unsigned int i = 0; i < record->count(); ++i) {
        Field* f = record->at(i);
        switch (f->getType()) {
            case FIELD_INT8:
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%ls = %d\n", f->getName(),
                              static_cast<int>(static_cast<Int8Field*>(f)->value()));
                break;
            case FIELD_INT16:
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%ls = %d\n", f->getName(),
                              static_cast<int>(static_cast<Int16Field*>(f)->value()));
                break;
            case FIELD_INT32:
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%ls = %d\n", f->getName(),
                              static_cast<int>(static_cast<Int32Field*>(f)->value()));
                break;
            case FIELD_INT64:
                // The host's printf reads "%I64d" as a padded int, so the
                // argument is handed over as one to stay well defined.
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%ls = %I64d\n", f->getName(),
                              static_cast<int>(static_cast<Int64Field*>(f)->value()));
                break;
            case FIELD_TEXT: {
                wchar_t const* v = static_cast<TextField*>(f)->value();
                log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "%ls = %ls\n", f->getName(),
                              v != nullptr ? v : L"");
                break;
            }
            default:
                break;
        }
    }
}

// ---- RecordSet -----------------------------------------------------------------

bool RecordSet::moveFirst() { return rs != nullptr && rs->moveFirst(); }
bool RecordSet::moveNext() { return rs != nullptr && rs->moveNext(); }
bool RecordSet::movePrevious() { return rs != nullptr && rs->movePrevious(); }
bool RecordSet::moveLast() { return rs != nullptr && rs->moveLast(); }
bool RecordSet::read() { return rs != nullptr && rs->read(); }
bool RecordSet::insert() { return rs != nullptr && rs->insert(); }
bool RecordSet::update() { return rs != nullptr && rs->update(); }
bool RecordSet::remove() { return rs != nullptr && rs->remove(); }
unsigned int RecordSet::count() { return rs != nullptr ? rs->count() : 0; }
int RecordSet::lock(int timeout) { return rs != nullptr ? rs->lock(timeout) : SYNC_FAILED; }
int RecordSet::unlock() { return rs != nullptr ? rs->unlock() : SYNC_FAILED; }

// An empty handle reads 0 or null and stores nothing.
#define FSCANNER_HANDLE_FIELD_ACCESS(Suffix, Value, FieldClass, TypeNumber)                   \
    Value RecordSet::getFieldAs##Suffix(wchar_t const* n) {                                   \
        return rs != nullptr ? rs->getFieldAs##Suffix(n) : static_cast<Value>(0);            \
    }                                                                                         \
    Value RecordSet::getFieldAs##Suffix(unsigned int i) {                                     \
        return rs != nullptr ? rs->getFieldAs##Suffix(i) : static_cast<Value>(0);            \
    }                                                                                         \
    void RecordSet::setFieldAs##Suffix(wchar_t const* n, Value v) {                           \
        if (rs != nullptr) rs->setFieldAs##Suffix(n, v);                                      \
    }                                                                                         \
    void RecordSet::setFieldAs##Suffix(unsigned int i, Value v) {                             \
        if (rs != nullptr) rs->setFieldAs##Suffix(i, v);                                      \
    }

FSCANNER_RECORDSET_FIELD_TYPES(FSCANNER_HANDLE_FIELD_ACCESS)

#undef FSCANNER_HANDLE_FIELD_ACCESS

bool RecordSet::setCriteria(CriteriaEvaluator* e, bool caseSensitive) {
    return rs != nullptr && rs->setCriteria(e, caseSensitive);
}

void RecordSet::printFields() {
    if (rs != nullptr) rs->printFields();
}

// ---- FS_Table: cursors ---------------------------------------------------------

RecordSet FS_Table::openRecordSet() {
    __recordSet* cursor = new __recordSet(this);
    recordSets.push_back(cursor);
    return RecordSet(cursor);
}

bool FS_Table::closeRecordSet(RecordSet& set) {
    __recordSet* cursor = set.get();
    if (cursor == nullptr) return false;
    for (size_t i = 0; i < recordSets.size(); ++i) {
        if (recordSets[i] == cursor) {
            recordSets.erase(recordSets.begin() + static_cast<long>(i));
            delete cursor;
            set.clear();
            return true;
        }
    }
    return false;
}

void FS_Table::deleteRecordSets() {
    for (size_t i = 0; i < recordSets.size(); ++i) delete recordSets[i];
    recordSets.clear();
}
