// Narrow text value of the host's base library.
//
// Holds its own copy of the characters; copies are deep.  A default or null
// construction gives the empty text.  Not thread-safe per object.
#ifndef FSCANNER_BASE_STRING_H
#define FSCANNER_BASE_STRING_H

class String {
public:
    String();
    String(const char* text);  // NOLINT: implicit by design, as hosts use it
    String(const String& other);
    String& operator=(const String& other);
    ~String();

    // Number of bytes before the terminating NUL.
    int length() const;
    // The byte at index, or 0 when index is outside 0..length()-1.
    char charAt(int index) const;
    // Three-way comparison: negative, 0 or positive as strcmp; a non-zero
    // ignoreCase compares as strcasecmp does.
    int compareTo(const String& other, int ignoreCase) const;
    // The characters, NUL-terminated; valid while the object lives unchanged.
    operator const char*() const;

private:
    char* text_;
    int length_;
};

#endif
