#include "fscanner/fscommon/naturalmerge.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"
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

// The files of the passes: the sorted file and the two scratch files.
//
// A pass reads a file front to back (a peek reads a record and steps back
// over it) or writes it front to back, a record at a time, twice per pass
// for every record.  Through a LinuxMmFile each pass ended in an msync and an
// fsync of all three files, and every write that crossed a page reserved
// disk space on its own; the passes' files are scratch, read back at once,
// and need neither.  This file keeps LinuxMmFile's rules for the callbacks
// (a read past the end copies what remains and sets the end flag, a full read
// clears it, a seek clears it and never passes the end, a write at the end
// appends) over a descriptor read and written in large pieces: reads go
// through a window of the file, appends through a buffer written out when
// full, before any read or seek, and at close.  Nothing is synced.
class PassFile : public AbstractFile {
public:
    explicit PassFile(const wchar_t* name) : fd(-1), logical(0), position(0), atEnd(false), failed(false) {
        char* narrow = name != nullptr ? utils::myWcsToMbsString(name) : nullptr;
        if (narrow != nullptr) path = narrow;
        delete[] narrow;
        window.reserve(kPiece);
        pending.reserve(kPiece);
    }
    ~PassFile() override { close(); }

    // As LinuxMmFile::create: the name is unlinked and made anew (0660).
    bool create() override {
        if (path.empty() || fd != -1) return false;
        fscanner::Env* env = fscanner::Env::Current();
        env->removeFile(path.c_str());
        int d = env->openFile(path.c_str(), O_RDWR | O_CREAT | O_TRUNC | O_CLOEXEC, 0660);
        if (d == -1) return false;
        reset(d, 0);
        return true;
    }
    bool open() override {
        if (path.empty() || fd != -1) return false;
        fscanner::Env* env = fscanner::Env::Current();
        int d = env->openFile(path.c_str(), O_RDWR | O_CLOEXEC);
        if (d == -1) return false;
        struct stat st;
        // Sizes are 32-bit words, as for every file of this interface.
        if (env->fileStatus(d, &st) != 0 || st.st_size < 0 ||
            static_cast<unsigned long long>(st.st_size) > 0xFFFFFFFFull) {
            env->closeFile(d);
            return false;
        }
        reset(d, static_cast<uint64_t>(st.st_size));
        return true;
    }
    bool close() override {
        if (fd == -1) return false;
        bool ok = flush();
        if (fscanner::Env::Current()->closeFile(fd) != 0) ok = false;
        fd = -1;
        logical = position = 0;
        window.clear();
        return ok && !failed;
    }
    unsigned int read(void* buffer, unsigned int length) override {
        if (fd == -1 || !flush()) {
            atEnd = true;
            return 0;
        }
        uint64_t available = position < logical ? logical - position : 0;
        uint64_t copied = length <= available ? length : available;
        atEnd = length > available;
        unsigned char* out = static_cast<unsigned char*>(buffer);
        uint64_t done = 0;
        while (done < copied) {
            if (position < windowStart || position >= windowStart + window.size()) {
                if (!fill(position)) {
                    atEnd = true;
                    break;
                }
            }
            uint64_t inWindow = windowStart + window.size() - position;
            uint64_t take = copied - done < inWindow ? copied - done : inWindow;
            std::memcpy(out + done, window.data() + (position - windowStart), static_cast<size_t>(take));
            done += take;
            position += take;
        }
        return static_cast<unsigned int>(done);
    }
    unsigned int write(void* buffer, unsigned int length) override {
        if (fd == -1 || failed) return 0;
        if (static_cast<uint64_t>(position) + length > 0xFFFFFFFFull) return 0;
        if (position != logical && !flush()) return 0;
        const unsigned char* in = static_cast<const unsigned char*>(buffer);
        if (position != logical) {
            // Not an append (the passes never write so): straight to the file.
            if (!writeAt(position, in, length)) return 0;
            invalidate(position, length);
        } else {
            if (pending.size() + length > kPiece && !flush()) return 0;
            if (length > kPiece) {
                if (!writeAt(position, in, length)) return 0;
                flushedEnd = position + length;
            } else {
                pending.insert(pending.end(), in, in + length);
            }
            invalidate(position, length);
        }
        position += length;
        if (position > logical) logical = position;
        return length;
    }
    bool seek(long offset, int origin) override {
        atEnd = false;
        long long target;
        if (!seekTarget(offset, origin, position, logical, &target)) return false;
        position = static_cast<uint64_t>(target);
        return true;
    }
    long tell() override { return static_cast<long>(position); }
    bool eof() override { return atEnd; }
    bool size(unsigned int* result) override {
        if (fd == -1) return false;
        *result = static_cast<unsigned int>(logical);
        return true;
    }

private:
    static const size_t kPiece = 1 << 18;

    void reset(int d, uint64_t size) {
        fd = d;
        logical = size;
        flushedEnd = size;
        position = 0;
        atEnd = false;
        failed = false;
        window.clear();
        windowStart = 0;
        pending.clear();
    }
    // Writes the appended bytes out; false (and the file failed) when the
    // disk refuses them.
    bool flush() {
        if (pending.empty()) return !failed;
        bool ok = writeAt(flushedEnd, pending.data(), pending.size());
        flushedEnd += pending.size();
        pending.clear();
        return ok;
    }
    bool writeAt(uint64_t at, const unsigned char* data, size_t length) {
        while (length > 0) {
            ssize_t n = fscanner::Env::Current()->writeFileAt(fd, data, length, static_cast<off_t>(at));
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) {
                failed = true;
                return false;
            }
            data += n;
            at += static_cast<uint64_t>(n);
            length -= static_cast<size_t>(n);
        }
        return true;
    }
    bool fill(uint64_t at) {
        window.resize(kPiece);
        size_t got = 0;
        while (got < kPiece && at + got < logical) {
            ssize_t n = fscanner::Env::Current()->readFileAt(fd, window.data() + got, kPiece - got,
                                                             static_cast<off_t>(at + got));
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) break;
            got += static_cast<size_t>(n);
        }
        window.resize(got);
        windowStart = at;
        return got != 0;
    }
    // Forgets the window where bytes were written under it.
    void invalidate(uint64_t at, size_t length) {
        if (at < windowStart + window.size() && at + length > windowStart) window.clear();
    }

    std::string path;
    int fd;
    uint64_t logical;     // the content's size, pending appends included
    uint64_t flushedEnd;  // the content's size on disk
    uint64_t position;
    bool atEnd;
    bool failed;
    std::vector<unsigned char> window;
    uint64_t windowStart = 0;
    std::vector<unsigned char> pending;  // appends not yet written
};

void removeScratch(const wchar_t* name) {
    char* narrow = utils::myWcsToMbsString(name);
    if (narrow != nullptr) fscanner::Env::Current()->removeFile(narrow);
    delete[] narrow;
}

// Traces a finished merge pass of either sort.  False, traced as well, when
// runs are still left after MAX_PASSES: the sort gives up and the records are
// not in order.
bool passWithinLimit(QvLogWrapper* trace, const wchar_t* file, unsigned int passes,
                     unsigned int runs) {
    trace->traceMAX(__LINE__, __FILE__, "sort", "NaturalMergeSort::sort - pass %u merged %u runs\n",
                    passes, runs);
    if (runs > 1 && passes >= MAX_PASSES) {
        trace->traceMIN(__LINE__, __FILE__, "sort",
                        "NaturalMergeSort::sort - still %u runs after %u passes on [%S]; "
                        "the records are not in order\n",
                        runs, passes, file);
        return false;
    }
    return true;
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
        // The side whose head goes first gives one record; when its run
        // ends there, the rest of the other side's run follows and the
        // merged run is complete.
        const bool fromA = compareRecords(headA, headB, mergeOperator, caseFlag);
        AbstractFile* from = fromA ? a : b;
        AbstractFile* other = fromA ? b : a;
        void*& headFrom = fromA ? headA : headB;
        void*& headOther = fromA ? headB : headA;
        freeRecord(headFrom);
        headFrom = nullptr;
        if (copy(from, target, &headFrom)) {
            freeRecord(headOther);
            headOther = nullptr;
            copyrun(other, target, &headOther);
            freeRecord(headA);
            freeRecord(headB);
            return;
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

    AbstractFile* input = new (std::nothrow) PassFile(file);
    if (input == nullptr) return false;
    if (!input->open()) {
        delete input;
        return false;
    }

    wchar_t* nameA = scratchName(file, NATURAL_MERGE_SCRATCH_A_WIDE);
    wchar_t* nameB = scratchName(file, NATURAL_MERGE_SCRATCH_B_WIDE);
    AbstractFile* scratchA = nameA != nullptr ? new (std::nothrow) PassFile(nameA) : nullptr;
    AbstractFile* scratchB = nameB != nullptr ? new (std::nothrow) PassFile(nameB) : nullptr;
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
        if (!passWithinLimit(trace, file, passes, runs)) {
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

// ---- the passes replayed in memory ------------------------------------------

namespace {

// Result files up to this size are sorted in memory: the file, its keys and
// the replay's arrays then take about twice as much (the 172,181 hits of a
// 200,000-entry generated tree: a 21 MiB file, and fsquery peaks at 39 to 45
// MiB), which holds a sort of up to some 400,000 hits inside what a query
// may use.  Larger files go
// through the passes on disk, in constant memory.
uint32_t g_replayLimitBytes = 48u << 20;

// A record between passes: its key number and the caller's id.  Key numbers
// that fit 32 bits travel in 8-byte items, which halves what each pass moves.
template <typename Key>
struct Item {
    Key key;
    uint32_t id;
};

// The two operators of one order on key numbers.  With Missing, the
// missing key (all ones) on either side makes both false, as the callbacks
// answer for a record without its key.
template <typename Key, bool Ascending, bool Missing>
struct Operators {
    typedef Key KeyType;
    static constexpr Key kMissing = static_cast<Key>(~static_cast<Key>(0));
    static bool missing(Key x, Key y) { return Missing && (x == kMissing || y == kMissing); }
    // The end-of-run operator between a record and its follower.
    static bool endsRun(Key x, Key y) {
        if (missing(x, y)) return false;
        return Ascending ? x > y : x < y;
    }
    // The merge operator between the heads of a and b: true takes a's.
    static bool takesA(Key x, Key y) {
        if (missing(x, y)) return false;
        return Ascending ? x <= y : x >= y;
    }
};

// The two scratch files of a pass, as arrays: the records dealt to each
// side, and the lengths of the runs each side holds as it would be read
// back (runs that met in one scratch file count as one).  The run lengths of
// side a fill their array from the front, those of b from the back.
template <typename Key>
struct Sides {
    explicit Sides(size_t capacity)
        : a(capacity), b(capacity), runs(capacity), sizeA(0), sizeB(0), runsA(0), runsB(0) {}

    void clear() { sizeA = sizeB = runsA = runsB = 0; }
    uint32_t& runA(size_t k) { return runs[k]; }
    uint32_t& runB(size_t k) { return runs[runs.size() - 1 - k]; }
    uint32_t runA(size_t k) const { return runs[k]; }
    uint32_t runB(size_t k) const { return runs[runs.size() - 1 - k]; }

    // Appends `length` records that form one run to side a (toA) or b: they
    // lengthen the side's last run unless the side's last record ends a run
    // with the first of them.
    template <class Ops>
    void append(bool toA, const Item<Key>* first, size_t length) {
        std::vector<Item<Key>>& side = toA ? a : b;
        size_t& size = toA ? sizeA : sizeB;
        size_t& runCount = toA ? runsA : runsB;
        if (size != 0 && !Ops::endsRun(side[size - 1].key, first->key)) {
            (toA ? runA(runCount - 1) : runB(runCount - 1)) += static_cast<uint32_t>(length);
        } else {
            (toA ? runA(runCount) : runB(runCount)) = static_cast<uint32_t>(length);
            ++runCount;
        }
        std::memcpy(side.data() + size, first, length * sizeof(Item<Key>));
        size += length;
    }

    std::vector<Item<Key>> a;
    std::vector<Item<Key>> b;
    std::vector<uint32_t> runs;
    size_t sizeA;
    size_t sizeB;
    size_t runsA;
    size_t runsB;
};

// The records a pass wrote back, in an array sized once.
template <typename Key>
struct Sequence {
    explicit Sequence(size_t capacity) : items(capacity), count(0) {}
    std::vector<Item<Key>> items;
    size_t count;
};

// distribute() over records of the input file: runs end by the keys as read
// from the file; a record the write refuses decides a run end and stays out.
// On the sides the keys are those of the records as written, which may end
// runs where the keys as read did not.
template <class Ops>
void distributeFirst(const std::vector<NaturalMergeReplay::Record>& in, Sides<typename Ops::KeyType>& sides) {
    typedef typename Ops::KeyType Key;
    sides.clear();
    size_t n = in.size();
    size_t i = 0;
    bool toA = true;
    while (i < n) {
        for (;;) {
            const NaturalMergeReplay::Record& x = in[i];
            if (x.written) {
                Item<Key> item = {static_cast<Key>(x.keyWritten), x.id};
                sides.template append<Ops>(toA, &item, 1);
            }
            ++i;
            if (i == n) break;
            if (Ops::endsRun(static_cast<Key>(x.keyInFile), static_cast<Key>(in[i].keyInFile))) break;
        }
        toA = !toA;
    }
}

// distribute() over the records a pass wrote back, a whole run at a time.
template <class Ops>
void distribute(const Sequence<typename Ops::KeyType>& in, Sides<typename Ops::KeyType>& sides) {
    sides.clear();
    size_t n = in.count;
    const Item<typename Ops::KeyType>* s = in.items.data();
    size_t i = 0;
    bool toA = true;
    while (i < n) {
        size_t start = i;
        ++i;
        while (i < n && !Ops::endsRun(s[i - 1].key, s[i].key)) ++i;
        sides.template append<Ops>(toA, s + start, i - start);
        toA = !toA;
    }
}

// merge(): mergerun while both sides hold runs, then copyrun what is left
// of a, then of b.  Returns the runs written.  The run lengths are known, so
// the merge of two runs only compares heads, and which side gives the next
// record (as good as random on unsorted input) is chosen without a branch.
template <class Ops>
unsigned int merge(const Sides<typename Ops::KeyType>& sides, Sequence<typename Ops::KeyType>& out) {
    typedef typename Ops::KeyType Key;
    const Item<Key>* a = sides.a.data();
    const Item<Key>* b = sides.b.data();
    Item<Key>* o = out.items.data();
    size_t ra = 0;
    size_t rb = 0;
    unsigned int runs = 0;
    for (; ra < sides.runsA && rb < sides.runsB; ++ra, ++rb) {
        size_t la = sides.runA(ra);
        size_t lb = sides.runB(rb);
        while (la != 0 && lb != 0) {
            bool takeA = Ops::takesA(a->key, b->key);
            const Item<Key>* from = takeA ? a : b;
            *o++ = *from;
            a += takeA;
            b += !takeA;
            la -= takeA;
            lb -= !takeA;
        }
        // The run of one side ended: the rest of the other's follows.
        std::memcpy(o, a, la * sizeof(Item<Key>));
        o += la;
        a += la;
        std::memcpy(o, b, lb * sizeof(Item<Key>));
        o += lb;
        b += lb;
        ++runs;
    }
    // What is left of one side, run by run.
    for (; ra < sides.runsA; ++ra, ++runs) {
        size_t la = sides.runA(ra);
        std::memcpy(o, a, la * sizeof(Item<Key>));
        o += la;
        a += la;
    }
    for (; rb < sides.runsB; ++rb, ++runs) {
        size_t lb = sides.runB(rb);
        std::memcpy(o, b, lb * sizeof(Item<Key>));
        o += lb;
        b += lb;
    }
    out.count = static_cast<size_t>(o - out.items.data());
    return runs;
}

// The pass loop of NaturalMergeSort::sort, with its traces; the order of the
// last pass goes to result.  Everything is allocated before the first trace.
template <class Ops>
bool replayPasses(const wchar_t* file, const std::vector<NaturalMergeReplay::Record>& records,
                  std::vector<uint32_t>& result) {
    typedef typename Ops::KeyType Key;
    size_t n = records.size();
    Sides<Key> sides(n);
    Sequence<Key> merged(n);
    result.clear();
    result.reserve(n);

    QvLogWrapper* trace = getQvLogFs();
    trace->traceMID(__LINE__, __FILE__, "sort", "NaturalMergeSort::sort - entering... [%S]\n", file);
    unsigned int passes = 0;
    unsigned int runs = 0;
    bool done = true;
    do {
        if (passes == 0) {
            distributeFirst<Ops>(records, sides);
        } else {
            distribute<Ops>(merged, sides);
        }
        runs = merge<Ops>(sides, merged);
        ++passes;
        if (!passWithinLimit(trace, file, passes, runs)) {
            done = false;
            break;
        }
    } while (runs > 1);
    for (size_t k = 0; k < merged.count; ++k) result.push_back(merged.items[k].id);
    return done;
}

template <typename Key>
bool replayOrder(const wchar_t* file, unsigned int order, bool keysMayBeMissing,
                 const std::vector<NaturalMergeReplay::Record>& records, std::vector<uint32_t>& result) {
    if (order == NaturalMergeSort::ORDER_ASCENDING) {
        return keysMayBeMissing ? replayPasses<Operators<Key, true, true>>(file, records, result)
                                : replayPasses<Operators<Key, true, false>>(file, records, result);
    }
    return keysMayBeMissing ? replayPasses<Operators<Key, false, true>>(file, records, result)
                            : replayPasses<Operators<Key, false, false>>(file, records, result);
}

}  // namespace

bool NaturalMergeReplay::sort(const wchar_t* file, unsigned int order, bool keysMayBeMissing,
                              const std::vector<Record>& records, std::vector<uint32_t>& result) {
    if (file == nullptr || (order != NaturalMergeSort::ORDER_ASCENDING &&
                            order != NaturalMergeSort::ORDER_DESCENDING)) {
        getQvLogFs()->traceMID(__LINE__, __FILE__, "sort", "NaturalMergeSort::sort - entering... [%S]\n",
                               file);
        return false;
    }
    // Numbers below 2^32 - 1 travel in 32 bits; the missing key, all ones in
    // 64 bits, becomes all ones in 32.
    // The comparisons skip the test for missing keys where no key is missing.
    bool narrow = true;
    bool anyMissing = false;
    for (const Record& r : records) {
        for (uint64_t key : {r.keyInFile, r.keyWritten}) {
            if (keysMayBeMissing && key == MISSING_KEY) {
                anyMissing = true;
            } else if (key >= 0xFFFFFFFFull) {
                narrow = false;
            }
        }
    }
    return narrow ? replayOrder<uint32_t>(file, order, anyMissing, records, result)
                  : replayOrder<uint64_t>(file, order, anyMissing, records, result);
}

uint32_t NaturalMergeReplay::limitBytes() {
    return g_replayLimitBytes;
}

void NaturalMergeReplay::setLimitBytes(uint32_t bytes) {
    g_replayLimitBytes = bytes;
}
