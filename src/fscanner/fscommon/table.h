// One table of the record store: a schema of typed columns, an append-only
// data file of variable-length records and a pointer file that maps a dense
// record number to its data offset.  Layout: table_format.h.
//
// Deletion zeroes the record's slot; the bytes stay until compaction.  An
// FS_Table has no internal locks and serves one thread at a time; lock() and
// unlock() exclude other processes and are taken by the callers, never by the
// table itself.  Operations answer by bool and write no trace.
#ifndef FSCANNER_FSCOMMON_TABLE_H
#define FSCANNER_FSCOMMON_TABLE_H

#include <cstdint>
#include <string>
#include <vector>

#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/sysfile.h"
#include "fscanner/fscommon/table_verify.h"

class __recordSet;
class RecordSet;

// Writes the 7-bit group encoding of value at the end of buffer[0..size) and
// returns the index of its first byte (length = size - index).  The table
// passes a 16-byte buffer; 0 gives index size - 1 with that byte 0x00.
int compressInt(unsigned long long value, char* buffer, int size);
// Value of the 7-bit group encoding at buffer (at most 10 bytes are read).
unsigned long long decompressInt(char* buffer);

// Header of an index list entry: three words, initialised 110, 0, 0.
class RecordHeader {
public:
    RecordHeader() : tag(110), first(0), second(0) {}
    RecordHeader(const RecordHeader& other) = default;
    RecordHeader& operator=(const RecordHeader& other) = default;

    uint32_t tag;
    uint32_t first;
    uint32_t second;
};

// Hash of a key over buckets: accumulator * 37 + character for every
// character, terminator included (one more multiplication by 37), signed
// 32-bit wrapping; the signed remainder, made non-negative.
int hash(wchar_t const* key, int buckets);
int hash(unsigned int value, int buckets);

// A hash index on one column: 65536 bucket slots of (record number, next slot)
// followed by overflow slots, in <dir><indexName>.idx.
class Index {
public:
    static const uint32_t BUCKETS = 65536;
    static const uint32_t EMPTY = 0xFFFFFFFFu;

    Index(wchar_t const* indexName, wchar_t const* dir, wchar_t const* fieldName);
    Index(const Index& other);
    ~Index();

    wchar_t const* getIndexName() const { return indexName; }
    wchar_t const* getFieldName() const { return fieldName; }
    wchar_t const* getIndexFileName() const { return indexFileName; }
    wchar_t const* getIndexFullPathName() const { return fullPath; }

    bool create();
    bool init();
    bool open();
    bool close();
    bool erase();
    bool read(unsigned int slot, unsigned int* id, unsigned int* next);
    // Puts id at the head of bucket's chain.
    bool write(unsigned int bucket, unsigned int id);
    // Makes room on disk for the one overflow slot a write may append, so
    // that the next write cannot fail for want of space.  False when the
    // index is closed or the disk cannot hold the slot (errno says why).
    bool reserveSlot();
    // Number of whole slots in the file; false when it is closed or its size
    // is not a whole number of slots (table_verify.cpp).
    bool slotCount(unsigned int* count);
    // Reads count slots from slot first into words, two words a slot; false
    // on a short read.
    bool readSlots(unsigned int first, unsigned int count, uint32_t* words);
    // The bytes of count slots from slot first as stored (two host-order
    // words a slot): in place in a mapping that holds them, else read into
    // spare; null on a short read.  Valid until the file or spare changes.
    const char* slotBytes(unsigned int first, unsigned int count, std::vector<char>& spare);

private:
    Index& operator=(const Index&) = delete;

    AbstractFile* file;
    wchar_t* indexName;
    wchar_t* fieldName;
    wchar_t* indexFileName;
    wchar_t* fullPath;
};

class FS_Table {
public:
    // Builds every file name (dir is resolved to a real path ending in "/")
    // and the lock object "<name>_t_mutex"; touches no table file.  On any
    // failure, or without a dir, all names stay null and create/open fail.
    FS_Table(wchar_t const* name, wchar_t const* dir, bool compressed);
    // Deletes indexes, closes both files, frees names, deletes the mutex
    // (which unlinks the lock file) and the cursors.
    ~FS_Table();

    // False while open; otherwise adds a column to the schema.
    bool addField(wchar_t const* name, unsigned int type);
    // New empty data and pointer files (existing ones are replaced) with the
    // schema in the header; removes this table's index list.
    bool create();
    // Opens both files, rebuilds the schema from the header and opens the
    // listed indexes.  A header that runs past the data file fails.
    bool open();
    // Closes files, indexes and cursors and empties the schema.  Always safe.
    bool close();
    // Removes data, pointer, index and index list files; false while open.
    bool erase();

    // Appends record (its own fields decide what is written) and takes the
    // next number; true when the count and the indexes were updated.  The
    // disk space of the slot, the record and an overflow slot in every index
    // is made sure of before anything is written, so an insert refused by a
    // full disk leaves the table exactly as it was.
    bool insert(Fields& record);
    // Reads record id into record's fields.  TRUE, record untouched, when the
    // table is closed.  After a read every field reports not null.  False at
    // a field of type 6 (never stored) or when the record runs past the file.
    bool read(unsigned int id, Fields& record);
    // The stored UTF-8 bytes of the text column at position column of record
    // id, found without decoding the record.  True only when read() of the
    // record would succeed: every column decodes and, under the guard, every
    // check of read() passes (an index on a text column is checked here only
    // for plain ASCII keys).  False whenever read() could answer otherwise,
    // and the caller then reads the record the full way.  The bytes are not
    // zero-terminated and stay valid until the next call on the table.
    // ascii, when not null, tells whether the bytes are plain ASCII (1..127).
    bool peekText(unsigned int id, unsigned int column, const unsigned char** text, uint32_t* length,
                  bool* ascii = nullptr);
    // A walk's way past the rows a filter on one text column turns away.
    // From id, where a walk (moveFirst, moveNext) stands, passes over the
    // following live rows whose text column column is plain ASCII that
    // reject(context, bytes, length) answers true for, each only when every
    // check peekText would make on it passes, and counts them into the walk
    // as moveNext does.  Stops before the first row it cannot pass so (one
    // the filter may want, one that fails a check or needs a check only a
    // read makes, the end of the pointer file) and leaves id at the last row
    // passed over: the walk goes on with moveNext and a full read of that
    // row, which note any damage.  Nothing is noted here.  Without the guard,
    // or outside a walk, it passes over nothing.  wanted, when given, is set
    // to the number of the row it stopped in front of when that row passed
    // every check of peekText, holds plain ASCII and was not turned away (a
    // peekText of it would answer those bytes), and to kNoRow otherwise.
    typedef bool (*TextReject)(void* context, const unsigned char* bytes, uint32_t length);
    static constexpr unsigned int kNoRow = 0xFFFFFFFFu;
    void skipRejected(unsigned int& id, unsigned int column, TextReject reject, void* context,
                      unsigned int* wanted = nullptr);
    // Plain table: overwrites in place unless a text changes its character
    // count, in which case the record moves to a new number.  Compressed
    // table: always moves.  The new number is not reported.  A move whose
    // insert fails answers false: in a compressed table the old record then
    // stays as it was; in a plain one, whose leading fields were already
    // overwritten, it is removed.
    bool update(unsigned int id, Fields& record);
    // Zeroes slot id; the data stays.
    bool remove(unsigned int id);

    bool moveFirst(unsigned int& id);
    bool moveNext(unsigned int& id);
    // Walks back one slot; over a removed slot it keeps reading forward while
    // counting the number down (see the .cpp).
    bool movePrevious(unsigned int& id);
    // Sets id to the last live number and index to live count - 1; returns 0
    // (false) in every case.
    bool moveLast(unsigned int& id, unsigned int& index);

    // True when the data file's position is at its end (false when closed).
    bool eof();
    // which 0: stored count, 1: deleted count.
    bool count(int which, unsigned int* result);
    bool incCount(int which);
    bool decCount(int which);
    bool count(int which, int delta);

    // Results of the mutex (-21 without one); unlock returns release()'s.
    int lock();
    int lock(long timeout);
    int unlock();

    // Hash indexes.  addHashIndex builds the index over the live records and
    // saves the list; removeHashIndex answers false even after a removal.
    bool addHashIndex(wchar_t const* indexName, wchar_t const* fieldName);
    bool removeHashIndex(wchar_t const* indexName);
    bool buildHashIndex(wchar_t const* indexName, wchar_t const* fieldName);
    // First live record of key's chain (key hashed as given: callers
    // upper-case text); next holds the chain's continuation.
    bool hashIndex_moveFirst(Index& index, wchar_t const* key, unsigned int& id, unsigned int& next);
    bool hashIndex_moveNext(Index& index, unsigned int& id, unsigned int& next);
    bool hashIndexesUpdate(Fields& record, unsigned int id);
    bool saveHashIndexList(std::vector<Index*>& list);
    bool retrieveHashIndexList(std::vector<Index*>& list);
    bool eraseHashIndexList(std::vector<Index*>& list);
    void freeHashIndexList(std::vector<Index*>& list);
    Index* searchHashIndexForIndexName(wchar_t const* name, bool remove);
    Index* searchHashIndexForFieldName(wchar_t const* name, bool remove);

    // Observers.
    unsigned int headerSize();
    unsigned int getBitmapSize() const { return bitmapSize; }
    bool isCompressed() const { return compressed; }
    Fields& getFields() { return schema; }
    wchar_t const* getName() const { return name; }
    wchar_t const* getDirectory() const { return directory; }
    wchar_t const* getDataPath() const { return dataPath; }
    wchar_t const* getPointerPath() const { return pointerPath; }
    wchar_t const* getIndexListName() const { return indexListName; }
    AbstractFile* getDataFile() const { return dataFile; }
    AbstractFile* getPointerFile() const { return pointerFile; }
    std::vector<Index*>& getIndexes() { return indexes; }

    // Cursors: the table owns every cursor it opens; close() and the
    // destructor delete them.  closeRecordSet deletes set's cursor and clears
    // the handle; false when the cursor is not this table's.
    RecordSet openRecordSet();
    bool closeRecordSet(RecordSet& set);

    // On a closed table: copies the live records into a fresh table when the
    // deleted count exceeds percent of the stored count, rebuilds the indexes
    // there and swaps the files in.  Leaves the table closed.  True for a
    // finished or skipped compaction; false for an open table, one that would
    // not open, or a failure on the way.
    bool compact(int percent);
    // Test seam: when set, called after each record the copy phase of
    // compact() has stored, with the number of records copied so far.  The
    // records reach the copy through its mapping, not through a call of the
    // Env, so a fault-injecting Env cannot stop the copy after a given
    // record; the later stages each begin with an Env call and are reached
    // through one.
    static void (*compactCopyHook)(unsigned int copied);

    static void setBit(unsigned int index, unsigned char* buffer);
    static bool checkBit(unsigned int index, unsigned char const* buffer);

    // Integrity guard (table_verify.cpp).  The formats carry no checksum, so
    // what can be checked is the agreement of the files with each other.
    // verify() checks an open table in time independent of its size: whole
    // slots, stored + deleted equal to the slot count and stored not above
    // it, the first live slot right behind the header, and every index file
    // whole slots and at least its buckets.  Passing or not, it arms the
    // guard until close(), and from then on each operation checks what it
    // relies on:
    //  - read() fails a live record whose slot points outside the records,
    //    that runs past the data file, does not end where the next live
    //    record starts, or whose key, for any index, is not on the chain of
    //    its bucket (a record a lookup met under a bucket must hash to that
    //    bucket; any other is searched on its key's chain); and a record
    //    the row check (setRowCheck) refuses;
    //  - hashIndex_moveFirst/moveNext fail a chain slot that names a record
    //    past the pointer file, an empty slot inside a chain, an empty bucket
    //    with a chain, and a link outside the overflow slots or not falling;
    //  - a walk from moveFirst through moveNext to the end of the pointer
    //    file fails live slots outside the records or not at rising offsets,
    //    and a stored count other than the live slots it passed;
    //  - chain searches of one index that add up to an eighth of its size
    //    check that index whole once, as verifyWhole() does.
    // The first failed check is kept as the table's damage; a damaged
    // table's reads fail.  False with the damage set on a failed check,
    // false without damage on a closed table.
    bool verify();
    // verify(), then every slot of the pointer file (rising offsets inside
    // the records, stored count equal to the live slots) and every index
    // whole (a sound set of chains holding each record number exactly
    // once), in time linear in those files.
    bool verifyWhole();
    // Under the guard: check, called on every record read whole with the
    // table's own columns, answers null for a sound record or the text of
    // its failed check, which becomes the damage of the data file.  No
    // effect before verify(); close() forgets it.  The context is the
    // caller's and must outlive the table's open state.
    void setRowCheck(char const* (*check)(void* context, Fields& record), void* context);
    bool isDamaged() const;
    // While the guard is armed the table also keeps its first failed write:
    // an insert or an update that could not be stored (a full disk) fails
    // every later insert and update until clearWriteFailure() or close(), so
    // that no row written after the gap can name a row that is missing.
    // Removals still work: they need no new space.  Without the guard the
    // false of the operation is the only report.
    bool writeFailed() const;
    // errno of the failed write (ENOSPC, EDQUOT, EFBIG, ...), 0 when unknown
    // or none failed; and the file that refused it, null while none did.
    int writeError() const;
    wchar_t const* failedWriteFile() const;
    void clearWriteFailure();
    // The file and the check of the first failure; null while none failed.
    wchar_t const* damagedFile() const;
    char const* damagedCheck() const;

private:
    FS_Table(const FS_Table&) = delete;
    FS_Table& operator=(const FS_Table&) = delete;

    void freeNames();
    void deleteRecordSets();
    bool growScratch(unsigned int characters);
    bool readSlot(unsigned int id, uint32_t* offset);
    bool writeValue(Field* field);
    bool readValue(Field* field);
    wchar_t* indexListPath();
    // The read without the guard's checks.
    bool readRecord(unsigned int id, Fields& record);
    bool guardedRead(unsigned int id, Fields& record);
    // The guarded read of a record whose checks all pass on its peeked
    // bytes, decoded from them; false (record possibly half written, as
    // after a failed read) whenever guardedRead must decide.
    bool peekedGuardedRead(unsigned int id, Fields& record);
    // The walk over the record at offset with the column types of layout:
    // the end of the record, and per column where its bytes begin in
    // peekBytes and its value; false where readRecord would fail.
    bool peekRecord(uint32_t offset, Fields& layout, uint32_t* end);
    // The decoding under peekRecord, on available bytes of a record held in
    // memory from its first byte: Done with the record's length, NeedMore
    // with the bytes it needs at least (never when complete says the file
    // holds no more), or Broken where readRecord would fail.  Column offsets
    // in peekColumns are from bytes.
    enum class PeekDecode { Done, NeedMore, Broken };
    PeekDecode decodePeeked(const unsigned char* bytes, uint32_t available, bool complete, Fields& layout,
                            uint32_t* length);
    // A compressed table's row as skipRejected passes over it: the columns
    // it looks at (the keys and the filtered text) decoded, the others only
    // stepped over, a run of numbers at a time.  buildSkim writes the steps
    // for the schema, one per decoded column or run, at most one a column;
    // false for a table it does not serve (integers not compressed, a type
    // it does not know).  skimRow follows them over a row held in memory
    // from its first byte: true with the length decodePeeked answers Done
    // with, and peekColumns as decodePeeked leaves them for the decoded
    // columns (the others keep what they held); false wherever decodePeeked
    // might answer otherwise (too few bytes behind a step, a number longer
    // than eight bytes, a text over 65,535 bytes), for decodePeeked to decide.
    struct SkimStep {
        unsigned char op;    // SKIM_* below
        unsigned char kind;  // FIELD_* type of a decoded column
        unsigned short n;    // numbers or bytes stepped over; the column decoded
    };
    enum : unsigned char { SKIM_NUMBERS, SKIM_BYTES, SKIM_INT8, SKIM_NUMBER, SKIM_TEXT, SKIM_PASS_TEXT };
    bool buildSkim(const bool* decoded, SkimStep* steps, unsigned int* count);
    // The program skipRejected built last, and the filtered column and key
    // columns it was built for (the schema of an open table stays).
    struct SkimProgram {
        static const unsigned int kMostKeys = 16;
        bool built = false;
        unsigned int column = 0;
        unsigned int keys = 0;
        unsigned int keyColumn[kMostKeys];
        std::vector<SkimStep> steps;  // one a column at most
        unsigned int count = 0;
        bool skim = false;
    };
    SkimProgram lastSkim;
    bool skimRow(const unsigned char* bytes, uint32_t available, const SkimStep* steps, unsigned int count,
                 uint32_t* length);
    // Stores the columns the last peekRecord found into the first count
    // fields of record, as the field-by-field read would; false when a text
    // finds no memory (the fields before it are stored).
    bool storePeeked(Fields& record, unsigned int count);
    // Decodes length stored UTF-8 bytes into field as readValue does; false
    // when memory runs out.
    bool storeText(TextField* field, const unsigned char* bytes, uint32_t length);
    // The guard's checks of guardedRead on the record just peeked; false on
    // any doubt.
    bool peekPassesGuard(unsigned int id, uint32_t end);
    // Keeps the buckets of a record inserted under the guard.
    void guardInsert(Fields& record, unsigned int id);
    // Keeps file and check as the damage unless one is kept; returns false.
    bool noteDamage(wchar_t const* file, char const* check);
    // Keeps file and the current errno as the failed write unless one is
    // kept (and only under the guard); returns false.
    bool noteWriteFailure(wchar_t const* file);
    // Room for one insert: slot, record bytes and an overflow slot in each
    // index; false as soon as one file cannot take its part.
    bool reserveInsert(unsigned int recordBytes);
    // Appends field's encoding to bytes; type 6 adds nothing.
    void encodeValue(Field* field, std::string* bytes);
    // The whole check of one index against slots record numbers; on
    // success entry's bucketOf answers the key checks from then on.
    bool verifyIndex(TableGuard::IndexBuckets& entry, uint32_t slots);
    // The guard's check of a live slot: inside the records, the first one
    // behind the header.  False with the damage noted.
    bool guardSlot(unsigned int id, uint32_t offset);
    // offset inside the data file, id a slot of the pointer file, slot one
    // of index's slots (sizes kept by the guard).
    bool insideData(uint32_t offset);
    bool insidePointers(uint32_t id);
    bool insideIndex(Index& index, uint32_t slot);
    // The guard's check of index slot (id, next) met on a chain.
    bool guardChainSlot(Index& index, uint32_t slot, uint32_t id, uint32_t next);
    // A lookup on bucket's chain goes on at overflow slot next; and the
    // bucket of a lookup that goes on at next, when one was kept.
    void guardChainAt(Index& index, uint32_t next, uint32_t bucket);
    bool guardChainBucket(Index& index, uint32_t next, uint32_t* bucket);
    // The lookup on index (null: bucket unknown) handed out id under bucket.
    void guardReached(Index* index, uint32_t id, uint32_t bucket);
    // Record id, whose key falls in bucket, is filed there in entry's index.
    bool guardFiled(TableGuard::IndexBuckets& entry, unsigned int id, uint32_t bucket);
    // guardFiled for every current index, keys taken from record.
    bool guardKeys(unsigned int id, Fields& record);
    // index is still one of the table's own: the guard's list keeps entries
    // of indexes dropped since, compared only.
    bool isCurrent(Index const* index) const;
    // A walk starts at slot 0 (firstOffset its slot), passes a live slot,
    // and reaches the end of the pointer file.
    void guardWalkStart(uint32_t firstOffset);
    bool guardWalkLive(unsigned int id, uint32_t offset);
    bool guardWalkEnd();
    void dropGuard();

    AbstractFile* dataFile;
    AbstractFile* pointerFile;
    wchar_t* scratch;
    unsigned int scratchCapacity;
    utils::DynamicBuffer<unsigned char> utf8;
    wchar_t* name;
    wchar_t* dataFileName;
    wchar_t* directory;
    wchar_t* dataPath;
    wchar_t* pointerPath;
    wchar_t* indexListName;
    unsigned int bitmapSize;
    bool compressed;
    Fields schema;
    std::vector<Index*> indexes;
    std::vector<__recordSet*> recordSets;
    AbstractMutex* mutex;
    TableGuard* guard;
    // peekText's copy of the record's bytes, and per column the offset of its
    // value in it, its length for text, and its value for integers.
    std::vector<unsigned char> peekBytes;
    struct PeekedColumn {
        uint32_t at;
        uint32_t length;
        unsigned long long number;
        int ascii;  // text: -1 not yet known, 0 no, 1 plain ASCII
    };
    bool peekedAscii(PeekedColumn& c, const unsigned char* bytes);
    std::vector<PeekedColumn> peekColumns;
    // Per entry of the guard's index list: its index and the column of its
    // key, found once.
    std::vector<std::pair<Index*, int>> peekGuardColumns;
    int peekGuardColumn(size_t k);
    // The bucket of the key a peeked column holds (bytes as given to
    // decodePeeked, readable of them); false where only the full read can
    // tell (text that is not plain ASCII).
    bool peekedBucket(unsigned int column, const unsigned char* bytes, uint32_t readable, int* bucket);
    // The same for a column whose kind the caller knows (text, or one of the
    // integer types), with the table of upperAsciiTable().
    bool peekedBucketOf(PeekedColumn& c, bool text, const unsigned char* bytes, uint32_t readable,
                        const uint32_t* upper, int* bucket);
    // towupper of each ASCII code 1..127, for the index keys of peeked text
    // and of inserted text; 0 and 128..255, which no plain ASCII text holds,
    // have a mark no upper case has (kNotPlainAscii).  Filled at first use.
    uint32_t upperAscii[256];
    bool upperAsciiReady = false;
    // The table upper-cases a..z and keeps every other plain byte, so
    // peeked keys are hashed eight bytes at a time (keyhash.h).
    bool upperAsciiWords = false;
    const uint32_t* upperAsciiTable();
    // The bucket of text's key: hash() of text upper-cased as wcsupper does,
    // without a copy of the text.
    int upperTextBucket(wchar_t const* text);
    // The last number peekedBucket hashed, and its bucket: the rows of one
    // directory follow each other and share their PATHID.
    uint32_t lastDecimal = 0;
    int lastDecimalBucket = -1;
};

#endif
