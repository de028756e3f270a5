// Natural merge sort of a file of records, in place, with two scratch files.
//
// The sorter knows nothing of the record format: five callbacks read, write,
// peek, compare and release records.  It holds at most three records in
// memory at a time (two peeked, one being moved), so a file larger than
// memory sorts in passes of two full reads and writes each.  Runs already in
// order are kept as they stand: a sorted file takes one pass, and the number
// of passes is about the binary logarithm of the number of natural runs.
//
// The sorter reads and writes its files in large pieces and never syncs
// them: they are scratch, read back at once.  The callbacks see the rules of
// a LinuxMmFile (see the .cpp).
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

#include <cstdint>
#include <cwchar>
#include <vector>

class AbstractFile;

// The scratch files of a sort are the sorted file's name followed by these
// (in the forms of the two kinds of name).  Whoever removes a file that may be
// in the middle of a sort removes these too.
const char* const NATURAL_MERGE_SCRATCH_A = ".a";
const char* const NATURAL_MERGE_SCRATCH_B = ".b";
const wchar_t* const NATURAL_MERGE_SCRATCH_A_WIDE = L".a";
const wchar_t* const NATURAL_MERGE_SCRATCH_B_WIDE = L".b";

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

// The passes of NaturalMergeSort::sort, replayed in memory.
//
// Where the records end up, ties included, and how many runs each pass
// merges follow from the sequence of records and the outcomes of the compare
// callback alone.  A caller that can give every record a number that compares
// as the callback compares the records (equal numbers for records the
// callback finds equal) gets that order from here without any scratch file,
// and writes its file once instead of reading and writing it twice per pass.
// The traces are sort()'s: "entering" with the file name, one line per pass
// with the runs it merged, and the same bound on the number of passes.
//
// Memory: 20 bytes per record besides the caller's records (36 when a key
// number needs more than 32 bits), all of it reserved before the first trace.
// Callers keep to files they may hold in memory (see limitBytes) and
// give larger ones to NaturalMergeSort::sort.
class NaturalMergeReplay {
public:
    // A record as the first pass reads it from the file.  The key numbers
    // need not be dense; see keysMayBeMissing for MISSING_KEY.
    struct Record {
        // Its number as read from the file: it decides where the first
        // distribution ends runs.
        uint64_t keyInFile;
        // Its number as read back after the write callback wrote it; the
        // same as keyInFile for a record that the write leaves unchanged.
        uint64_t keyWritten;
        // The caller's number for the record.
        uint32_t id;
        // False when the write callback refuses the record: it still takes
        // part in the first distribution's run ends, and is not in the result.
        bool written;
    };

    // With keysMayBeMissing, the number of a record whose key is missing:
    // every operator compares false with it on either side, as the callbacks
    // treat a record without its key.  Otherwise an ordinary number.
    static constexpr uint64_t MISSING_KEY = ~static_cast<uint64_t>(0);

    // Replays sort(file, order, ...) over records, given in file order; file
    // serves only the traces.  order is 1 ascending or 2 descending (anything
    // else returns false at once, after the "entering" trace, as sort()
    // does).  result receives the ids in the order the sort leaves in the
    // file.  False, with result holding the order of the last pass, when the
    // bound on passes ended the sort as it ends sort().  May throw
    // std::bad_alloc before the first trace, never after it.
    static bool sort(const wchar_t* file, unsigned int order, bool keysMayBeMissing,
                     const std::vector<Record>& records, std::vector<uint32_t>& result);

    // Size in bytes up to which a result file is sorted in memory.  For tests
    // of the passes on disk; not thread-safe.
    static uint32_t limitBytes();
    static void setLimitBytes(uint32_t bytes);
};

#endif
