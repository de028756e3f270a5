// The sort of a result file, behind FsResultSetReader_OnFile::sort.
//
// The order is that of NaturalMergeSort's passes over FsFileInfo records,
// ties included, and the file's bytes are those the passes would write.  A
// file within NaturalMergeReplay::limitBytes() is sorted in memory: read
// once, ordered by the replay of the passes, written once.  A larger one
// goes through the passes themselves, with callbacks that move each record
// as its bytes and its key.  See the .cpp for how the two keep to the passes.
//
// One thread per sort; sorts of different files may run in parallel.
#ifndef FSCANNER_FS_FS_RESULTSET_SORT_H
#define FSCANNER_FS_FS_RESULTSET_SORT_H

#include <cwchar>

#include "fscanner/fscommon/naturalmerge.h"

namespace resultsort {

// Sorts the result file `name` (wideName for the traces) in memory by key 1
// path, 2 name, 3 full path, 4 size, in order 1 ascending or 2 descending,
// caseSensitive as FsFileInfo::compare takes it.  False, with nothing
// traced, written or changed, when the file is to go through the passes on
// disk instead: an order other than 1 or 2 (the passes refuse it, with their
// trace), a file that cannot be read or is above the limit, a key character
// without an order-keeping form, or memory that cannot be had.  True once the
// sort has begun (its trace is NaturalMergeSort::sort's); a file that cannot
// be written back then stays as it was, with a trace.
bool sortInMemory(const char* name, const wchar_t* wideName, unsigned int key, unsigned int order,
                  bool caseSensitive);

// The callbacks of the passes on disk for a key.
struct PassCallbacks {
    NaturalMergeSort::CompareCallback compare;
    NaturalMergeSort::ReadCallback read;
    NaturalMergeSort::WriteCallback write;
    NaturalMergeSort::PeekCallback peek;
    NaturalMergeSort::FreeCallback free;
};

// Fills callbacks for key 1 to 4; false for another key.
bool passCallbacks(unsigned int key, PassCallbacks& callbacks);

}  // namespace resultsort

#endif
