// Natural merge sort of a file of records, in place, with two scratch files.
//
// The sorter knows nothing of the record format: five callbacks read, write,
// peek, compare and release records.  It holds at most three records in
// memory at a time (two peeked, one being moved), so a file larger than
// memory sorts in passes of two full reads and writes each.  Runs already in
// order are kept as they stand: a sorted file takes one pass, and the number
// of passes is about the binary logarithm of the number of natural runs.
//
// Scratch files are the file's name followed by ".a" and ".b".  While a pass
// stands between re-creating the file and the end of its merge, the records
// not yet merged back exist only in the scratch files; a crash there loses
// them, and nothing recovers them.
//
// Stability: ties between the two scratch files go to ".a", so one merge is
// stable between its sides.  Runs that land one behind the other in the same
// scratch file may join into one longer run, and then a record from a later
// part of the input can pass an equal one from an earlier part.  Equal keys
// therefore keep their input order within a run and within one merge, not
// across the whole sort.
//
// One object serves one thread at a time; it has no lock.
#ifndef FSCANNER_FSCOMMON_NATURALMERGE_H
#define FSCANNER_FSCOMMON_NATURALMERGE_H

#include <cwchar>

class AbstractFile;

class NaturalMergeSort {
public:
    // Applies operator op to records a and b (0 equal, 1 greater or equal,
    // 2 less or equal, 3 greater, 4 less, 5 not equal); flag is the caller's
    // case flag, passed through untouched.
    typedef bool (*CompareCallback)(void* a, void* b, unsigned int op, bool flag);
    // Reads the next record, allocating it, and advances the file.  Gives the
    // record through *record; non-zero when one was read.
    typedef int (*ReadCallback)(AbstractFile* file, void** record);
    // Appends a record at the file's position; non-zero on success.
    typedef int (*WriteCallback)(AbstractFile* file, void* record);
    // Reads the next record without advancing the file; false when there is
    // none.  The record is allocated and given through *record.
    typedef bool (*PeekCallback)(AbstractFile* file, void** record);
    // Releases a record; accepts null.
    typedef void (*FreeCallback)(void* record);

    // Values of sort()'s order.
    static constexpr unsigned int ORDER_ASCENDING = 1;
    static constexpr unsigned int ORDER_DESCENDING = 2;

    // Stores the callbacks.  If any of them is null, all are set to null and
    // every later sort() returns false.
    NaturalMergeSort(CompareCallback compare, ReadCallback read, WriteCallback write,
                     PeekCallback peek, FreeCallback free);

    // Sorts the named file in place, order 1 ascending, 2 descending; flag
    // goes to every compare call.  False for a null name, another order,
    // missing callbacks, a file that cannot be opened, or scratch names or
    // files that cannot be made: in those cases the file is left as it was.
    // True when the passes ran to their end; the scratch files are then gone.
    bool sort(wchar_t* file, unsigned int order, bool flag);

    // True when the file's position equals its end; false for null.  The
    // position is kept (the file's end flag is cleared on the way).
    bool eof(AbstractFile* file);

    // The steps of a pass.  They are public so that callers can drive a pass
    // on files of their own; sort() is the ordinary entry.

    // Moves one record from source to target.  True when the run ended behind
    // it: no record could be read, no record follows, or the following one
    // ends the run.  *next receives the following record (owned by the
    // caller) or null.
    bool copy(AbstractFile* source, AbstractFile* target, void** next);
    // Moves one whole run; *next receives the record peeked behind it, or null.
    void copyrun(AbstractFile* source, AbstractFile* target, void** next);
    // Deals whole runs of source to a and b alternately, until source ends.
    void distribute(AbstractFile* source, AbstractFile* a, AbstractFile* b);
    // Merges one run of a with one run of b into target; ties go to a.
    void mergerun(AbstractFile* a, AbstractFile* b, AbstractFile* target);
    // Merges a and b into target run by run; returns the number of runs written.
    unsigned int merge(AbstractFile* a, AbstractFile* b, AbstractFile* target);

private:
    NaturalMergeSort(const NaturalMergeSort&);
    NaturalMergeSort& operator=(const NaturalMergeSort&);

    bool hasCallbacks() const;

    CompareCallback compareRecords;
    ReadCallback readRecord;
    WriteCallback writeRecord;
    PeekCallback peekRecord;
    FreeCallback freeRecord;
    // Operator that ends a run when it holds between a record and its follower.
    unsigned int endOfRunOperator;
    // Operator that, holding between the two heads of a merge, picks side a.
    unsigned int mergeOperator;
    bool caseFlag;
};

#endif
