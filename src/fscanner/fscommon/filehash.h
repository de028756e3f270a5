// Lookup sets over files: the checksums a caller looks for (FileHashBlackBox)
// and a set of name masks that answers "does any mask match this name" without
// trying each mask in turn (FileMaskLookup, with its StaticHashTable).
//
// None of these classes has a lock; one object serves one thread.
#ifndef FSCANNER_FSCOMMON_FILEHASH_H
#define FSCANNER_FSCOMMON_FILEHASH_H

#include <cwchar>
#include <vector>

#include "fscanner/fscommon/checksum.h"

// The checksums a caller is looking for.  Values are appended as given,
// duplicates included.
class FileHashBlackBox {
public:
    FileHashBlackBox();

    // Each appends the value and adds 1 to size().
    void insert_crc32(unsigned int value);
    void insert_q32(unsigned int value);
    void insert_md5(u_int128 value);
    void insert_sha256(u_int256 value);

    bool empty() const;
    unsigned int size() const;

    // True when a sum that info.flags marks (CRC32, Q32, MD5) is among the
    // values.  Flags 0 gives false.  SHA-256 values are counted by size() but
    // never compared, so a set of SHA-256 values alone matches nothing.
    bool find(FileChecksumInfo const& info) const;

private:
    std::vector<unsigned int> crc32Values;
    std::vector<unsigned int> q32Values;
    std::vector<u_int128> md5Values;
    std::vector<u_int256> sha256Values;
    unsigned int count;
};

// An open-addressing hash set over a fixed list of strings, built once.  It
// copies the list of pointers but not the strings: they must outlive the table.
// The probe start is random per table (seeded from the clock through
// srand/rand, which disturbs the process's rand sequence), so slot order
// differs between runs.
class StaticHashTable {
public:
    StaticHashTable(std::vector<wchar_t*> const& strings, bool caseSensitive);
    ~StaticHashTable();
    StaticHashTable(StaticHashTable const&) = delete;
    StaticHashTable& operator=(StaticHashTable const&) = delete;

    // True when a string of the table equals text by wcsvccmp with the
    // table's case flag.  The hash itself never folds case, so a table that
    // ignores case finds a name in other case only if both hash alike.
    bool hash_find(wchar_t const* text) const;
    // Places string i of the list into the table.  Refuses (without counting)
    // an index outside the list or a table with no free slot.
    void hash_insert(int i);
    // h = h * 2 + scatter[c & 255] over the characters, in 32 bits.
    static unsigned int hash_scatter(wchar_t const* text);

    // Index into the list of the string hash_find would hit, or -1.
    int hash_index(wchar_t const* text) const;
    int getSize() const { return size; }
    int getCount() const { return count; }
    int getSeed() const { return seed; }

private:
    int* slots;     // size entries, -1 for free, else an index into strings
    int mask;       // size - 1
    int seed;
    int size;       // a power of two, at least 16, above 3 * strings
    int count;
    bool caseSensitive;
    std::vector<wchar_t*> strings;
};

// A set of file masks with two phases: insert the masks, commit_transaction,
// then find.  Masks are sorted by shape: plain names, "*tail", "head*" go to
// hash tables; anything else ("a?c", "*x*", "a*b") is tried one by one.
//
// Ownership: the object keeps its own copies of the masks.  Its destructor
// releases the length block and the four lists, but not the copied strings
// nor the three hash tables: an object lives as long as its expression.
class FileMaskLookup {
public:
    // Shape bits, also the results of insert.
    static constexpr unsigned char SHAPE_PLAIN = 1;
    static constexpr unsigned char SHAPE_LEFT = 2;   // "*tail"
    static constexpr unsigned char SHAPE_RIGHT = 4;  // "head*"
    static constexpr unsigned char SHAPE_HARD = 8;
    // Entries of the length block; a mask of a hashed shape with more fixed
    // characters than LENGTH_SLOTS - 1 is refused.
    static constexpr int LENGTH_SLOTS = 4096;

    FileMaskLookup();
    ~FileMaskLookup();
    FileMaskLookup(FileMaskLookup const&) = delete;
    FileMaskLookup& operator=(FileMaskLookup const&) = delete;

    // Returns the shape bit of the mask, or 0 when it is refused: an empty or
    // null mask, a mask too long for the length block, the bare "*" (which
    // makes the set match everything), or any mask once "*" was inserted.
    // Every call but the last kind counts in size().
    int insert(wchar_t const* mask);
    // Inserts every double-quoted string of list; text outside quotes is
    // ignored.  A string of 4096 characters or more is skipped with a trace.
    // Returns 0.
    int insert_stringlist(wchar_t const* list);
    // Builds the hash tables; after the last insert, before the first find.
    // Masks inserted later stay out of the tables.
    void commit_transaction(bool caseSensitive);
    // True when a mask matches name.  False before commit_transaction.
    bool find(wchar_t const* name);
    int size() const;

private:
    unsigned int present;       // shape bits that hold at least one mask
    bool caseSensitive;
    bool committed;
    bool matchesAll;
    unsigned char* lengths;     // LENGTH_SLOTS shape-bit bytes, by fixed-character count
    std::vector<wchar_t*> plainNames;
    std::vector<wchar_t*> leftTails;
    std::vector<wchar_t*> rightHeads;
    std::vector<wchar_t*> hardMasks;
    StaticHashTable* plainTable;
    StaticHashTable* leftTable;
    StaticHashTable* rightTable;
    int inserted;
    int currentLength;
};

#endif
