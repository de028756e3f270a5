#include "fscanner/fscommon/naturalmerge.h"

#include <unistd.h>

#include <new>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/sysfile.h"
#include "fscanner/fscommon/utils.h"

namespace {

// Operator codes of the compare callback (the codes of the expression
// language's simple comparisons).
const unsigned int OP_GREATER_OR_EQUAL = 1;
const unsigned int OP_LESS_OR_EQUAL = 2;
const unsigned int OP_GREATER = 3;
const unsigned int OP_LESS = 4;

// Each pass at least halves the number of runs, so 2^32 records need 33
// passes.  A compare callback that is not a consistent order could keep the
// count above 1 for ever; this bound ends such a sort with all records still
// in the file.
const unsigned int MAX_PASSES = 64;

// name followed by suffix, in a kelm_malloc block; null when out of memory.
wchar_t* scratchName(const wchar_t* name, const wchar_t* suffix) {
    size_t nameLength = std::wcslen(name);
    size_t suffixLength = std::wcslen(suffix);
    wchar_t* result =
        static_cast<wchar_t*>(kelm_malloc((nameLength + suffixLength + 1) * sizeof(wchar_t)));
    if (result == nullptr) return nullptr;
    std::wmemcpy(result, name, nameLength);
    std::wmemcpy(result + nameLength, suffix, suffixLength + 1);
    return result;
}

void removeScratch(const wchar_t* name) {
    char* narrow = utils::myWcsToMbsString(name);
    if (narrow != nullptr) ::unlink(narrow);
    delete[] narrow;
}

}  // namespace

NaturalMergeSort::NaturalMergeSort(CompareCallback compare, ReadCallback read,
                                   WriteCallback write, PeekCallback peek, FreeCallback free)
    : compareRecords(compare),
      readRecord(read),
      writeRecord(write),
      peekRecord(peek),
      freeRecord(free),
      endOfRunOperator(OP_GREATER),
      mergeOperator(OP_LESS_OR_EQUAL),
      caseFlag(false) {
    if (!hasCallbacks()) {
        compareRecords = nullptr;
        readRecord = nullptr;
        writeRecord = nullptr;
        peekRecord = nullptr;
        freeRecord = nullptr;
    }
}

bool NaturalMergeSort::hasCallbacks() const {
    return compareRecords != nullptr && readRecord != nullptr && writeRecord != nullptr &&
           peekRecord != nullptr && freeRecord != nullptr;
}

bool NaturalMergeSort::eof(AbstractFile* file) {
    if (file == nullptr) return false;
    long position = file->tell();
    if (!file->seek(0, SEEK_FROM_END)) return false;
    long end = file->tell();
    file->seek(position, SEEK_FROM_START);
    return position == end;
}

bool NaturalMergeSort::copy(AbstractFile* source, AbstractFile* target, void** next) {
    *next = nullptr;
    void* current = nullptr;
    int read = readRecord(source, &current);
    // The end of the file shows as a failed read; the record, if any, is not
    // written.  A read that fails before the end (damaged bytes) ends the run
    // the same way, so that nothing half-read is passed on.
    if (source->eof() || read == 0 || current == nullptr) {
        freeRecord(current);
        return true;
    }
    writeRecord(target, current);

    bool runEnded = true;
    void* following = nullptr;
    if (peekRecord(source, &following) && following != nullptr) {
        runEnded = compareRecords(current, following, endOfRunOperator, caseFlag);
        *next = following;
    } else {
        freeRecord(following);
    }
    freeRecord(current);
    return runEnded;
}

void NaturalMergeSort::copyrun(AbstractFile* source, AbstractFile* target, void** next) {
    *next = nullptr;
    for (;;) {
        void* peeked = nullptr;
        if (copy(source, target, &peeked)) {
            *next = peeked;
            return;
        }
        freeRecord(peeked);
    }
}

void NaturalMergeSort::distribute(AbstractFile* source, AbstractFile* a, AbstractFile* b) {
    for (;;) {
        long before = source->tell();
        void* peeked = nullptr;
        copyrun(source, a, &peeked);
        freeRecord(peeked);
        if (eof(source)) return;
        copyrun(source, b, &peeked);
        freeRecord(peeked);
        if (eof(source)) return;
        // Bytes that never yield a record and never reach the end: stop
        // rather than go round for ever.  Valid files always advance.
        if (source->tell() == before) return;
    }
}

void NaturalMergeSort::mergerun(AbstractFile* a, AbstractFile* b, AbstractFile* target) {
    void* headA = nullptr;
    void* headB = nullptr;
    for (;;) {
        if (headA == nullptr) peekRecord(a, &headA);
        if (headB == nullptr) peekRecord(b, &headB);
        // merge() calls this only when both sides hold data, so both heads
        // exist for valid files.  A side whose bytes yield no record counts
        // as an ended run: the other side's run is copied on its own.
        if (headA == nullptr || headB == nullptr) {
            AbstractFile* rest = headA != nullptr ? a : (headB != nullptr ? b : nullptr);
            freeRecord(headA);
            freeRecord(headB);
            if (rest != nullptr) {
                void* peeked = nullptr;
                copyrun(rest, target, &peeked);
                freeRecord(peeked);
            }
            return;
        }
        if (compareRecords(headA, headB, mergeOperator, caseFlag)) {
            freeRecord(headA);
            headA = nullptr;
            if (copy(a, target, &headA)) {
                freeRecord(headB);
                headB = nullptr;
                copyrun(b, target, &headB);
                freeRecord(headA);
                freeRecord(headB);
                return;
            }
        } else {
            freeRecord(headB);
            headB = nullptr;
            if (copy(b, target, &headB)) {
                freeRecord(headA);
                headA = nullptr;
                copyrun(a, target, &headA);
                freeRecord(headA);
                freeRecord(headB);
                return;
            }
        }
    }
}

unsigned int NaturalMergeSort::merge(AbstractFile* a, AbstractFile* b, AbstractFile* target) {
    unsigned int runs = 0;
    while (!eof(a) && !eof(b)) {
        long positionA = a->tell();
        long positionB = b->tell();
        mergerun(a, b, target);
        ++runs;
        if (a->tell() == positionA && b->tell() == positionB) break;
    }
    AbstractFile* sides[2] = {a, b};
    for (AbstractFile* side : sides) {
        while (!eof(side)) {
            long position = side->tell();
            void* peeked = nullptr;
            copyrun(side, target, &peeked);
            freeRecord(peeked);
            ++runs;
            if (side->tell() == position) break;
        }
    }
    return runs;
}

bool NaturalMergeSort::sort(wchar_t* file, unsigned int order, bool flag) {
    QvLogWrapper* trace = getQvLogFs();
    trace->traceMID(__LINE__, __FILE__, __func__, "NaturalMergeSort::sort - entering... [%S]\n",
                    file);
    if (file == nullptr || !hasCallbacks()) return false;
    if (order == ORDER_ASCENDING) {
        endOfRunOperator = OP_GREATER;
        mergeOperator = OP_LESS_OR_EQUAL;
    } else if (order == ORDER_DESCENDING) {
        endOfRunOperator = OP_LESS;
        mergeOperator = OP_GREATER_OR_EQUAL;
    } else {
        return false;
    }
    caseFlag = flag;

    AbstractFile* input = SysFactory::createMmFile(file);
    if (input == nullptr) return false;
    if (!input->open()) {
        delete input;
        return false;
    }

    wchar_t* nameA = scratchName(file, L".a");
    wchar_t* nameB = scratchName(file, L".b");
    AbstractFile* scratchA = nameA != nullptr ? SysFactory::createMmFile(nameA) : nullptr;
    AbstractFile* scratchB = nameB != nullptr ? SysFactory::createMmFile(nameB) : nullptr;
    if (scratchA == nullptr || scratchB == nullptr) {
        delete scratchA;
        delete scratchB;
        kelm_free(nameA);
        kelm_free(nameB);
        input->close();
        delete input;
        return false;
    }

    bool done = true;
    unsigned int passes = 0;
    unsigned int runs = 0;
    do {
        if (!scratchA->create() || !scratchB->create()) {
            // Nothing of the input has been touched in this pass yet.
            trace->traceMIN(__LINE__, __FILE__, __func__,
                            "NaturalMergeSort::sort - cannot create the scratch files of [%S]\n",
                            file);
            done = false;
            break;
        }
        input->seek(0, SEEK_FROM_START);
        distribute(input, scratchA, scratchB);
        scratchA->seek(0, SEEK_FROM_START);
        scratchB->seek(0, SEEK_FROM_START);
        input->close();
        if (!input->create()) {
            // The records now exist only in the scratch files: leave them in
            // place for whoever can recover them.
            trace->traceMIN(__LINE__, __FILE__, __func__,
                            "NaturalMergeSort::sort - cannot re-create [%S]; records stay in "
                            "its scratch files\n",
                            file);
            delete scratchA;
            delete scratchB;
            kelm_free(nameA);
            kelm_free(nameB);
            delete input;
            return false;
        }
        runs = merge(scratchA, scratchB, input);
        scratchA->close();
        scratchB->close();
        ++passes;
        trace->traceMAX(__LINE__, __FILE__, __func__,
                        "NaturalMergeSort::sort - pass %u merged %u runs\n", passes, runs);
        if (runs > 1 && passes >= MAX_PASSES) {
            trace->traceMIN(__LINE__, __FILE__, __func__,
                            "NaturalMergeSort::sort - still %u runs after %u passes on [%S]; "
                            "the records are not in order\n",
                            runs, passes, file);
            done = false;
            break;
        }
    } while (runs > 1);

    delete scratchA;
    delete scratchB;
    removeScratch(nameA);
    removeScratch(nameB);
    kelm_free(nameA);
    kelm_free(nameB);
    input->close();
    delete input;
    return done;
}
