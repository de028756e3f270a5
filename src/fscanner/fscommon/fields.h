// Typed values of a record, and the columns of a table.
//
// A Field has a name (wide, from kelm_malloc, may be null), a type number and
// a null flag that is set at construction and cleared whenever a value is
// stored.  Type numbers are stored in table files:
//   1 Int8Field  2 Int16Field  3 Int32Field  4 Int64Field  (unsigned)
//   5 TextField  (wide string)   6 HexField (length-prefixed bytes)
// Fields owns an ordered list of Field objects.  No locking: one thread per
// object.
#ifndef FSCANNER_FSCOMMON_FIELDS_H
#define FSCANNER_FSCOMMON_FIELDS_H

#include <cstdint>
#include <vector>

const unsigned int FIELD_INT8 = 1;
const unsigned int FIELD_INT16 = 2;
const unsigned int FIELD_INT32 = 3;
const unsigned int FIELD_INT64 = 4;
const unsigned int FIELD_TEXT = 5;
const unsigned int FIELD_HEX = 6;

class Field {
public:
    // Copies name; a null name or a failed allocation leaves it null (the
    // object still stands).  The null flag starts set.
    Field(wchar_t const* name, unsigned int type);
    Field(const Field& other);
    // Empty in every class: keeps Field abstract.
    virtual void dummy() = 0;
    virtual ~Field();
    // Size of the value: 5, 6, 8, 12 for the integers; 8 + 4 per character
    // for text (8 when null); stored length + 1 for hex.
    virtual unsigned int size() = 0;

    // False for null or a failed allocation; else replaces the name.
    bool setName(wchar_t const* name);
    wchar_t const* getName() const { return name; }
    unsigned int getType() const { return type; }
    bool isNull() const { return nullFlag != 0; }
    void setNull(bool isNull) { nullFlag = isNull ? 1 : 0; }

protected:
    Field& operator=(const Field& other);  // name and null flag

    wchar_t* name;
    uint32_t type;
    unsigned char nullFlag;
};

class Int8Field : public Field {
public:
    Int8Field();
    explicit Int8Field(wchar_t const* name);
    Int8Field(const Int8Field& other);
    Int8Field& operator=(const Int8Field& other);
    void dummy() override {}
    unsigned int size() override { return 5; }
    void value(unsigned char x) { v = x; nullFlag = 0; }
    unsigned char value() const { return v; }

private:
    unsigned char v;
};

class Int16Field : public Field {
public:
    Int16Field();
    explicit Int16Field(wchar_t const* name);
    Int16Field(const Int16Field& other);
    Int16Field& operator=(const Int16Field& other);
    void dummy() override {}
    unsigned int size() override { return 6; }
    void value(unsigned short x) { v = x; nullFlag = 0; }
    unsigned short value() const { return v; }

private:
    unsigned short v;
};

class Int32Field : public Field {
public:
    Int32Field();
    explicit Int32Field(wchar_t const* name);
    Int32Field(const Int32Field& other);
    Int32Field& operator=(const Int32Field& other);
    void dummy() override {}
    unsigned int size() override { return 8; }
    void value(unsigned int x) { v = x; nullFlag = 0; }
    unsigned int value() const { return v; }

private:
    uint32_t v;
};

class Int64Field : public Field {
public:
    Int64Field();
    explicit Int64Field(wchar_t const* name);
    Int64Field(const Int64Field& other);
    Int64Field& operator=(const Int64Field& other);
    void dummy() override {}
    unsigned int size() override { return 12; }
    void value(unsigned long long x) { v = x; nullFlag = 0; }
    unsigned long long value() const { return v; }

private:
    uint64_t v;
};

class TextField : public Field {
public:
    // Values of up to INLINE_CHARS - 1 characters live inline; longer ones in
    // a kelm_malloc block owned by the field.
    static constexpr unsigned int INLINE_CHARS = 128;

    TextField();
    explicit TextField(wchar_t const* name);
    TextField(const TextField& other);
    TextField& operator=(const TextField& other);
    ~TextField() override;
    void dummy() override {}
    unsigned int size() override;
    // No effect on a nameless field.  null: pointer null, null flag kept.
    // Otherwise copies text and clears the null flag.
    void value(wchar_t const* text);
    // The current value; null after a null was stored.
    wchar_t const* value() const { return current; }
    // True while the value lives in the inline buffer.
    bool isInline() const { return current == inlineBuffer; }

private:
    void freeHeap();

    wchar_t inlineBuffer[INLINE_CHARS];
    wchar_t* current;
};

class HexField : public Field {
public:
    HexField();
    explicit HexField(wchar_t const* name);
    HexField(const HexField& other);
    HexField& operator=(const HexField& other);
    void dummy() override {}
    // First byte + 1.  A null value counts as 1 (no bytes).
    unsigned int size() override;
    // No effect on a nameless field.  null: pointer null.  Otherwise copies
    // bytes[0] + 1 bytes and clears the null flag.
    void value(unsigned char const* bytes);
    unsigned char const* value() const { return current; }

private:
    unsigned char buffer[256];
    unsigned char* current;
};

class Fields {
public:
    Fields() {}
    Fields(const Fields& other);
    Fields& operator=(const Fields& other);
    ~Fields();

    unsigned int count() const { return static_cast<unsigned int>(fields.size()); }
    // Unchecked.
    Field* at(unsigned int index) const { return fields[index]; }
    // First field whose name equals name (wcscmp), or null.
    Field* name(wchar_t const* name) const;
    // Position of that field, or -1: a caller that reads a column row after
    // row looks it up once and then goes by position.
    int indexOf(wchar_t const* name) const;
    // Sum of size() over all fields.
    unsigned int size() const;

    // False for a null name or a type outside 1..6; else appends a new field.
    bool add(wchar_t const* name, unsigned int type);
    // Append a copy; a nameless source is refused (false).
    bool add(Int8Field& field);
    bool add(Int16Field& field);
    bool add(Int32Field& field);
    bool add(Int64Field& field);
    bool add(TextField& field);
    bool add(HexField& field);
    void removeAll();

private:
    bool addCopy(Field* copy);
    void copyFrom(const Fields& other);

    std::vector<Field*> fields;
};

#endif
