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
      nameFilter(nullptr) {}

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
      nameFilter(nullptr) {}

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
                wchar_t const* text = info->getStringValue();
                size_t n = wcslen(text) + 1;
                key = static_cast<wchar_t*>(kelm_malloc(n * sizeof(wchar_t)));
                if (key != nullptr) std::memcpy(key, text, n * sizeof(wchar_t));
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

// A record fits when no criteria are set or the evaluator accepts it.  The
// evaluator has the last word on every candidate, also on those of a hash
// chain, which holds collisions and stale entries.
bool __recordSet::fits() { return !hasCriteria || evaluator->check(record, nullptr, caseFlag) > 0; }

bool __recordSet::readAndDecide(bool* accepted) {
    if (nameFilter != nullptr) {
        const unsigned char* text = nullptr;
        uint32_t length = 0;
        bool ascii = false;
        if (table->peekText(id, nameFilter->getColumn(), &text, &length, &ascii) && ascii &&
            !nameFilter->mayMatchAscii(text, length, caseFlag)) {
            *accepted = false;
            return true;
        }
    }
    if (!read()) return false;
    *accepted = fits();
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
    if (!table->moveFirst(id)) return false;
    for (;;) {
        bool accepted = false;
        if (!readAndDecide(&accepted)) return false;
        if (accepted) {
            position = 0;
            return true;
        }
        if (!table->moveNext(id)) return false;
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
        if (!table->moveNext(id)) return false;
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

unsigned char __recordSet::getFieldAsInt8(wchar_t const* name) {
    Int8Field* f = column<Int8Field>(record, name, FIELD_INT8);
    return f != nullptr ? f->value() : 0;
}
unsigned char __recordSet::getFieldAsInt8(unsigned int i) {
    Int8Field* f = column<Int8Field>(record, i, FIELD_INT8);
    return f != nullptr ? f->value() : 0;
}
unsigned short __recordSet::getFieldAsInt16(wchar_t const* name) {
    Int16Field* f = column<Int16Field>(record, name, FIELD_INT16);
    return f != nullptr ? f->value() : 0;
}
unsigned short __recordSet::getFieldAsInt16(unsigned int i) {
    Int16Field* f = column<Int16Field>(record, i, FIELD_INT16);
    return f != nullptr ? f->value() : 0;
}
unsigned int __recordSet::getFieldAsInt32(wchar_t const* name) {
    Int32Field* f = column<Int32Field>(record, name, FIELD_INT32);
    return f != nullptr ? f->value() : 0;
}
unsigned int __recordSet::getFieldAsInt32(unsigned int i) {
    Int32Field* f = column<Int32Field>(record, i, FIELD_INT32);
    return f != nullptr ? f->value() : 0;
}
unsigned long long __recordSet::getFieldAsInt64(wchar_t const* name) {
    Int64Field* f = column<Int64Field>(record, name, FIELD_INT64);
    return f != nullptr ? f->value() : 0;
}
unsigned long long __recordSet::getFieldAsInt64(unsigned int i) {
    Int64Field* f = column<Int64Field>(record, i, FIELD_INT64);
    return f != nullptr ? f->value() : 0;
}
wchar_t const* __recordSet::getFieldAsString(wchar_t const* name) {
    TextField* f = column<TextField>(record, name, FIELD_TEXT);
    return f != nullptr ? f->value() : nullptr;
}
wchar_t const* __recordSet::getFieldAsString(unsigned int i) {
    TextField* f = column<TextField>(record, i, FIELD_TEXT);
    return f != nullptr ? f->value() : nullptr;
}
unsigned char const* __recordSet::getFieldAsHex(wchar_t const* name) {
    HexField* f = column<HexField>(record, name, FIELD_HEX);
    return f != nullptr ? f->value() : nullptr;
}
unsigned char const* __recordSet::getFieldAsHex(unsigned int i) {
    HexField* f = column<HexField>(record, i, FIELD_HEX);
    return f != nullptr ? f->value() : nullptr;
}

void __recordSet::setFieldAsInt8(wchar_t const* name, unsigned char v) {
    if (Int8Field* f = column<Int8Field>(record, name, FIELD_INT8)) f->value(v);
}
void __recordSet::setFieldAsInt8(unsigned int i, unsigned char v) {
    if (Int8Field* f = column<Int8Field>(record, i, FIELD_INT8)) f->value(v);
}
void __recordSet::setFieldAsInt16(wchar_t const* name, unsigned short v) {
    if (Int16Field* f = column<Int16Field>(record, name, FIELD_INT16)) f->value(v);
}
void __recordSet::setFieldAsInt16(unsigned int i, unsigned short v) {
    if (Int16Field* f = column<Int16Field>(record, i, FIELD_INT16)) f->value(v);
}
void __recordSet::setFieldAsInt32(wchar_t const* name, unsigned int v) {
    if (Int32Field* f = column<Int32Field>(record, name, FIELD_INT32)) f->value(v);
}
void __recordSet::setFieldAsInt32(unsigned int i, unsigned int v) {
    if (Int32Field* f = column<Int32Field>(record, i, FIELD_INT32)) f->value(v);
}
void __recordSet::setFieldAsInt64(wchar_t const* name, unsigned long long v) {
    if (Int64Field* f = column<Int64Field>(record, name, FIELD_INT64)) f->value(v);
}
void __recordSet::setFieldAsInt64(unsigned int i, unsigned long long v) {
    if (Int64Field* f = column<Int64Field>(record, i, FIELD_INT64)) f->value(v);
}
void __recordSet::setFieldAsString(wchar_t const* name, wchar_t const* v) {
    if (TextField* f = column<TextField>(record, name, FIELD_TEXT)) f->value(v);
}
void __recordSet::setFieldAsString(unsigned int i, wchar_t const* v) {
    if (TextField* f = column<TextField>(record, i, FIELD_TEXT)) f->value(v);
}
void __recordSet::setFieldAsHex(wchar_t const* name, unsigned char const* v) {
    if (HexField* f = column<HexField>(record, name, FIELD_HEX)) f->value(v);
}
void __recordSet::setFieldAsHex(unsigned int i, unsigned char const* v) {
    if (HexField* f = column<HexField>(record, i, FIELD_HEX)) f->value(v);
}

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

unsigned char RecordSet::getFieldAsInt8(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsInt8(n) : 0; }
unsigned char RecordSet::getFieldAsInt8(unsigned int i) { return rs != nullptr ? rs->getFieldAsInt8(i) : 0; }
unsigned short RecordSet::getFieldAsInt16(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsInt16(n) : 0; }
unsigned short RecordSet::getFieldAsInt16(unsigned int i) { return rs != nullptr ? rs->getFieldAsInt16(i) : 0; }
unsigned int RecordSet::getFieldAsInt32(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsInt32(n) : 0; }
unsigned int RecordSet::getFieldAsInt32(unsigned int i) { return rs != nullptr ? rs->getFieldAsInt32(i) : 0; }
unsigned long long RecordSet::getFieldAsInt64(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsInt64(n) : 0; }
unsigned long long RecordSet::getFieldAsInt64(unsigned int i) { return rs != nullptr ? rs->getFieldAsInt64(i) : 0; }
wchar_t const* RecordSet::getFieldAsString(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsString(n) : nullptr; }
wchar_t const* RecordSet::getFieldAsString(unsigned int i) { return rs != nullptr ? rs->getFieldAsString(i) : nullptr; }
unsigned char const* RecordSet::getFieldAsHex(wchar_t const* n) { return rs != nullptr ? rs->getFieldAsHex(n) : nullptr; }
unsigned char const* RecordSet::getFieldAsHex(unsigned int i) { return rs != nullptr ? rs->getFieldAsHex(i) : nullptr; }

void RecordSet::setFieldAsInt8(wchar_t const* n, unsigned char v) { if (rs != nullptr) rs->setFieldAsInt8(n, v); }
void RecordSet::setFieldAsInt8(unsigned int i, unsigned char v) { if (rs != nullptr) rs->setFieldAsInt8(i, v); }
void RecordSet::setFieldAsInt16(wchar_t const* n, unsigned short v) { if (rs != nullptr) rs->setFieldAsInt16(n, v); }
void RecordSet::setFieldAsInt16(unsigned int i, unsigned short v) { if (rs != nullptr) rs->setFieldAsInt16(i, v); }
void RecordSet::setFieldAsInt32(wchar_t const* n, unsigned int v) { if (rs != nullptr) rs->setFieldAsInt32(n, v); }
void RecordSet::setFieldAsInt32(unsigned int i, unsigned int v) { if (rs != nullptr) rs->setFieldAsInt32(i, v); }
void RecordSet::setFieldAsInt64(wchar_t const* n, unsigned long long v) { if (rs != nullptr) rs->setFieldAsInt64(n, v); }
void RecordSet::setFieldAsInt64(unsigned int i, unsigned long long v) { if (rs != nullptr) rs->setFieldAsInt64(i, v); }
void RecordSet::setFieldAsString(wchar_t const* n, wchar_t const* v) { if (rs != nullptr) rs->setFieldAsString(n, v); }
void RecordSet::setFieldAsString(unsigned int i, wchar_t const* v) { if (rs != nullptr) rs->setFieldAsString(i, v); }
void RecordSet::setFieldAsHex(wchar_t const* n, unsigned char const* v) { if (rs != nullptr) rs->setFieldAsHex(n, v); }
void RecordSet::setFieldAsHex(unsigned int i, unsigned char const* v) { if (rs != nullptr) rs->setFieldAsHex(i, v); }

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
