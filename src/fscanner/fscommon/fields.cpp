#include "fscanner/fscommon/fields.h"

#include <cstring>
#include <cwchar>

#include "base/kelmem.h"
#include "fscanner/fscommon/stringhelper.h"

// ---- Field ------------------------------------------------------------------

Field::Field(wchar_t const* fieldName, unsigned int fieldType)
    : name(wideDuplicate(fieldName)), type(fieldType), nullFlag(1) {}

Field::Field(const Field& other)
    : name(wideDuplicate(other.name)), type(other.type), nullFlag(other.nullFlag) {}

Field::~Field() { kelm_free(name); }

Field& Field::operator=(const Field& other) {
    if (this != &other) {
        wchar_t* copy = wideDuplicate(other.name);
        kelm_free(name);
        name = copy;
        nullFlag = other.nullFlag;
    }
    return *this;
}

bool Field::setName(wchar_t const* newName) {
    if (newName == nullptr) return false;
    wchar_t* copy = wideDuplicate(newName);
    if (copy == nullptr) return false;
    kelm_free(name);
    name = copy;
    return true;
}

// ---- integer fields ---------------------------------------------------------

#define FSCANNER_INT_FIELD(Class, TypeNumber)                                   \
    Class::Class() : Field(nullptr, TypeNumber), v(0) {}                        \
    Class::Class(wchar_t const* fieldName) : Field(fieldName, TypeNumber), v(0) {} \
    Class::Class(const Class& other) : Field(other), v(other.v) {}              \
    Class& Class::operator=(const Class& other) {                               \
        Field::operator=(other);                                                \
        v = other.v;                                                            \
        return *this;                                                           \
    }

FSCANNER_INT_FIELD(Int8Field, FIELD_INT8)
FSCANNER_INT_FIELD(Int16Field, FIELD_INT16)
FSCANNER_INT_FIELD(Int32Field, FIELD_INT32)
FSCANNER_INT_FIELD(Int64Field, FIELD_INT64)

#undef FSCANNER_INT_FIELD

// ---- TextField --------------------------------------------------------------

TextField::TextField() : Field(nullptr, FIELD_TEXT), current(inlineBuffer) { inlineBuffer[0] = 0; }

TextField::TextField(wchar_t const* fieldName) : Field(fieldName, FIELD_TEXT), current(inlineBuffer) {
    inlineBuffer[0] = 0;
}

TextField::TextField(const TextField& other) : Field(other), current(inlineBuffer) {
    inlineBuffer[0] = 0;
    value(other.current);
    nullFlag = other.nullFlag;
}

TextField& TextField::operator=(const TextField& other) {
    if (this == &other) return *this;
    Field::operator=(other);
    value(other.current);
    nullFlag = other.nullFlag;
    return *this;
}

TextField::~TextField() { freeHeap(); }

void TextField::freeHeap() {
    if (current != inlineBuffer && current != nullptr) kelm_free(current);
    current = inlineBuffer;
}

unsigned int TextField::size() {
    if (current == nullptr) return 8;
    return 8 + 4 * static_cast<unsigned int>(wcslen(current));
}

void TextField::value(wchar_t const* text) {
    if (name == nullptr) return;
    wchar_t* oldHeap = (current != inlineBuffer) ? current : nullptr;
    if (text == nullptr) {
        kelm_free(oldHeap);
        current = nullptr;
        return;
    }
    // text may point into our own value, so the old block is freed only after
    // the copy is made.
    size_t n = wcslen(text);
    if (n < INLINE_CHARS) {
        std::memmove(inlineBuffer, text, (n + 1) * sizeof(wchar_t));
        current = inlineBuffer;
    } else {
        wchar_t* block = wideDuplicate(text);
        if (block == nullptr) {
            inlineBuffer[0] = 0;  // out of memory: an empty value, never a dangling one
            block = inlineBuffer;
        }
        current = block;
    }
    if (oldHeap != current) kelm_free(oldHeap);
    nullFlag = 0;
}

// ---- HexField ---------------------------------------------------------------

HexField::HexField() : Field(nullptr, FIELD_HEX), current(buffer) { std::memset(buffer, 0, sizeof buffer); }

HexField::HexField(wchar_t const* fieldName) : Field(fieldName, FIELD_HEX), current(buffer) {
    std::memset(buffer, 0, sizeof buffer);
}

HexField::HexField(const HexField& other) : Field(other), current(buffer) {
    std::memset(buffer, 0, sizeof buffer);
    if (other.current == nullptr) {
        current = nullptr;
    } else {
        std::memcpy(buffer, other.current, static_cast<size_t>(other.current[0]) + 1);
    }
}

HexField& HexField::operator=(const HexField& other) {
    if (this == &other) return *this;
    Field::operator=(other);
    if (other.current == nullptr) {
        current = nullptr;
    } else {
        std::memmove(buffer, other.current, static_cast<size_t>(other.current[0]) + 1);
        current = buffer;
    }
    return *this;
}

unsigned int HexField::size() {
    if (current == nullptr) return 1;
    return static_cast<unsigned int>(current[0]) + 1;
}

void HexField::value(unsigned char const* bytes) {
    if (name == nullptr) return;
    if (bytes == nullptr) {
        current = nullptr;
        return;
    }
    std::memmove(buffer, bytes, static_cast<size_t>(bytes[0]) + 1);
    current = buffer;
    nullFlag = 0;
}

// ---- Fields -----------------------------------------------------------------

Fields::Fields(const Fields& other) : fields() { copyFrom(other); }

Fields& Fields::operator=(const Fields& other) {
    if (this != &other) {
        removeAll();
        copyFrom(other);
    }
    return *this;
}

Fields::~Fields() { removeAll(); }

void Fields::copyFrom(const Fields& other) {
    for (Field* f : other.fields) {
        switch (f->getType()) {
            case FIELD_INT8: add(*static_cast<Int8Field*>(f)); break;
            case FIELD_INT16: add(*static_cast<Int16Field*>(f)); break;
            case FIELD_INT32: add(*static_cast<Int32Field*>(f)); break;
            case FIELD_INT64: add(*static_cast<Int64Field*>(f)); break;
            case FIELD_TEXT: add(*static_cast<TextField*>(f)); break;
            case FIELD_HEX: add(*static_cast<HexField*>(f)); break;
            default: break;  // unknown kinds are dropped
        }
    }
}

Field* Fields::name(wchar_t const* fieldName) const {
    int i = indexOf(fieldName);
    return i >= 0 ? fields[static_cast<size_t>(i)] : nullptr;
}

int Fields::indexOf(wchar_t const* fieldName) const {
    if (fieldName == nullptr) return -1;
    for (size_t i = 0; i < fields.size(); ++i) {
        wchar_t const* n = fields[i]->getName();
        // The first character tells most column names apart without a call.
        if (n != nullptr && n[0] == fieldName[0] && wcscmp(n, fieldName) == 0) return static_cast<int>(i);
    }
    return -1;
}

unsigned int Fields::size() const {
    unsigned int total = 0;
    for (Field* f : fields) total += f->size();
    return total;
}

bool Fields::add(wchar_t const* fieldName, unsigned int type) {
    if (fieldName == nullptr) return false;
    Field* f = nullptr;
    switch (type) {
        case FIELD_INT8: f = new Int8Field(fieldName); break;
        case FIELD_INT16: f = new Int16Field(fieldName); break;
        case FIELD_INT32: f = new Int32Field(fieldName); break;
        case FIELD_INT64: f = new Int64Field(fieldName); break;
        case FIELD_TEXT: f = new TextField(fieldName); break;
        case FIELD_HEX: f = new HexField(fieldName); break;
        default: return false;
    }
    fields.push_back(f);
    return true;
}

bool Fields::addCopy(Field* copy) {
    if (copy->getName() == nullptr) {
        delete copy;
        return false;
    }
    fields.push_back(copy);
    return true;
}

bool Fields::add(Int8Field& field) { return addCopy(new Int8Field(field)); }
bool Fields::add(Int16Field& field) { return addCopy(new Int16Field(field)); }
bool Fields::add(Int32Field& field) { return addCopy(new Int32Field(field)); }
bool Fields::add(Int64Field& field) { return addCopy(new Int64Field(field)); }
bool Fields::add(TextField& field) { return addCopy(new TextField(field)); }
bool Fields::add(HexField& field) { return addCopy(new HexField(field)); }

void Fields::removeAll() {
    for (Field* f : fields) delete f;
    fields.clear();
}
