#include "fscanner/fscommon/sysfile.h"

#include <fcntl.h>
#include <linux/fiemap.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <new>

#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"

using fscanner::Env;

namespace {

char* const kUnmapped = reinterpret_cast<char*>(-1);

// Multibyte form of a wide name in a 4096-byte buffer, as every system call
// of the library gets it.  False when the name does not convert or fit.
bool narrowName(wchar_t const* wide, char (&out)[4096]) {
    std::memset(out, 0, sizeof out);
    size_t n = wcstombs(out, wide, sizeof out - 1);
    if (n == static_cast<size_t>(-1)) return false;
    out[sizeof out - 1] = 0;
    return true;
}

// The reservation step for content that reaches contentEnd: RESERVE_STEP
// while the content is small, a 32nd of it (as a power of two) as it grows,
// at most RESERVE_STEP_MAX.  A file then takes some 32 reservation calls
// each time it doubles instead of one per page, and holds at most a 32nd
// more than its content (a small one, a page) reserved ahead: a disk that
// holds the content with a few percent to spare holds the reservations.
uint64_t reserveStep(uint64_t contentEnd) {
    uint64_t step = LinuxMmFile::RESERVE_STEP;
    while (step < LinuxMmFile::RESERVE_STEP_MAX && step * 2 * 32 <= contentEnd) step *= 2;
    return step;
}

// End, exclusive, of the bytes that are backed on disk for a file whose
// content reaches contentEnd inside an allocation of allocated bytes: the
// content rounded up to its reservation step, never past the allocation.
// The step only grows with the content and each step divides the next, so
// the end never falls as the content grows: what lies below the end for the
// old content is below it for the new, and only the difference is reserved.
uint64_t reservedEnd(uint64_t contentEnd, uint64_t allocated) {
    const uint64_t step = reserveStep(contentEnd);
    uint64_t rounded = (contentEnd + step - 1) / step * step;
    return rounded < allocated ? rounded : allocated;
}

// The reservation: 0 or the error number (posix_fallocate reports it as its
// result and leaves errno alone).  Where the file system has no fallocate,
// the C library emulates it by writing a zero into every block of the range,
// which backs the blocks on ordinary file systems; copy-on-write and
// compressing file systems can still refuse a later store, and nothing short
// of writing each byte for real could promise more there.
int reserveSpace(char const* name, int fd, uint64_t offset, uint64_t length) {
    int rc;
    do {
        rc = Env::Current()->reserveSpace(name, fd, static_cast<off_t>(offset), static_cast<off_t>(length));
    } while (rc == EINTR);
    return rc;
}

// True when every byte of [from, to) lies in an extent the file system has
// given the file already (written, unwritten or delayed).  Asked only after
// a refusal: some file systems (XFS) charge a reservation in full even where
// the blocks are there, so a full disk would refuse a write the space of
// which reserve() took a moment before.  False where the question cannot be
// asked (tmpfs has no extent map, and charges only for new pages anyway).
bool rangeIsAllocated(int fd, uint64_t from, uint64_t to) {
    const unsigned int kExtents = 16;
    alignas(struct fiemap) unsigned char raw[sizeof(struct fiemap) + kExtents * sizeof(struct fiemap_extent)];
    uint64_t covered = from;
    while (covered < to) {
        std::memset(raw, 0, sizeof raw);
        struct fiemap* map = reinterpret_cast<struct fiemap*>(raw);
        map->fm_start = covered;
        map->fm_length = to - covered;
        map->fm_extent_count = kExtents;
        if (Env::Current()->deviceControl(fd, FS_IOC_FIEMAP, map) != 0 || map->fm_mapped_extents == 0) return false;
        uint64_t before = covered;
        for (unsigned int i = 0; i < map->fm_mapped_extents && covered < to; ++i) {
            const struct fiemap_extent& extent = map->fm_extents[i];
            if (extent.fe_logical > covered) return false;  // a hole before this extent
            uint64_t end = extent.fe_logical + extent.fe_length;
            if (end > covered) covered = end;
        }
        if (covered == before) return false;
    }
    return true;
}

// log2 of the system's page size, asked once.
unsigned int pageShift() {
    static const unsigned int shift = [] {
        long page = sysconf(_SC_PAGESIZE);
        unsigned int bits = 12;
        if (page > 0) {
            bits = 0;
            while ((1L << (bits + 1)) <= page) ++bits;
        }
        return bits;
    }();
    return shift;
}

// Pages a read fault maps at once when the page cache holds them (the
// kernel's fault-around, 64 KiB by default): a read that jumps counts them
// all, since they all become resident.
const uint32_t kFaultAroundPages = 16;

}  // namespace

// ---- StdFile ------------------------------------------------------------------

StdFile::StdFile(wchar_t const* fileName) : stream(nullptr), name(nullptr) {
    if (fileName != nullptr) {
        size_t n = wcslen(fileName) + 1;
        name = static_cast<wchar_t*>(kelm_malloc(n * sizeof(wchar_t)));
        if (name != nullptr) std::memcpy(name, fileName, n * sizeof(wchar_t));
    }
}

StdFile::~StdFile() {
    kelm_free(name);
    name = nullptr;
    close();
}

bool StdFile::openMode(const char* mode) {
    if (name == nullptr) return false;
    char narrow[4096];
    if (!narrowName(name, narrow)) return false;
    Env* env = Env::Current();
    if (stream != nullptr) env->closeStream(stream);  // reopening must not leak the old stream
    stream = env->openStream(narrow, mode);
    return stream != nullptr;
}

bool StdFile::create() { return openMode("w+b"); }

bool StdFile::open() { return openMode("r+b"); }

bool StdFile::close() {
    if (stream == nullptr) return false;
    // fclose writes what is still buffered: a full disk shows here, and the
    // file is then shorter than what write() accepted.  The stream is gone
    // either way.
    bool flushed = Env::Current()->closeStream(stream) == 0;
    stream = nullptr;
    return flushed;
}

unsigned int StdFile::read(void* buffer, unsigned int length) {
    return static_cast<unsigned int>(fread(buffer, 1, length, stream));
}

unsigned int StdFile::write(void* buffer, unsigned int length) {
    return static_cast<unsigned int>(fwrite(buffer, 1, length, stream));
}

bool StdFile::seek(long offset, int origin) {
    if (stream == nullptr) return false;
    int whence;
    switch (origin) {
        case SEEK_FROM_START: whence = SEEK_SET; break;
        case SEEK_FROM_CURRENT: whence = SEEK_CUR; break;
        case SEEK_FROM_END: whence = SEEK_END; break;
        default: return false;
    }
    fseek(stream, offset, whence);  // its report is deliberately not passed on
    return true;
}

long StdFile::tell() { return ftell(stream); }

bool StdFile::eof() { return feof(stream) != 0; }

bool StdFile::size(unsigned int* result) {
    if (stream == nullptr) return false;
    // 64-bit offsets, so that a file past what `long` or the 32-bit result
    // can hold is refused instead of reported as its size modulo 4 GiB.
    off_t here = ftello(stream);
    fseeko(stream, 0, SEEK_END);
    off_t end = ftello(stream);
    fseeko(stream, here, SEEK_SET);
    if (end < 0 || static_cast<unsigned long long>(end) > 0xFFFFFFFFull) return false;
    *result = static_cast<unsigned int>(end);
    return true;
}

// ---- LinuxMmFile ----------------------------------------------------------------

LinuxMmFile::LinuxMmFile(char const* fileName)
    : fd(-1), logical(0), allocated(0), position(0), address(kUnmapped), eofFlag(0), name(nullptr),
      written(false), touchedPages(0), lastPage(~0u), lastFirstPage(~0u), passPages(0), readPages(0), refaultedPages(0),
      budgetPages(0), mappedLength(0) {
    if (fileName != nullptr) name = i_strdup(fileName);
}

LinuxMmFile::~LinuxMmFile() {
    close();
    kelm_free(name);
}

bool LinuxMmFile::create() {
    if (name == nullptr || fd != -1) return false;
    Env* env = Env::Current();
    env->removeFile(name);
    int d = env->openFile(name, O_RDWR | O_CREAT | O_TRUNC | O_NONBLOCK, 0660);
    if (d == -1) return false;
    fd = d;
    logical = 0;
    allocated = 0;
    position = 0;
    eofFlag = 0;
    written = false;
    return true;
}

bool LinuxMmFile::open() {
    if (name == nullptr || fd != -1) return false;
    Env* env = Env::Current();
    int d = env->openFile(name, O_RDWR | O_NONBLOCK, 0660);
    if (d == -1) return false;
    fd = d;
    written = false;
    unsigned int onDisk = 0;
    if (!size(&onDisk)) {
        // Not one of ours (too long to describe): left as it is, not cut to
        // a logical size of 0 by a later close.
        env->closeFile(fd);
        fd = -1;
        return false;
    }
    logical = onDisk;
    allocated = onDisk;
    position = 0;
    eofFlag = 0;
    if (onDisk == 0) return true;
    // Fewer blocks than bytes: holes (the padding a crash leaves, or a file
    // written without reservation), which a store through the mapping would
    // have to fill.  They are backed now or the file is not opened.
    struct stat st;
    if (env->fileStatus(fd, &st) == 0 && static_cast<unsigned long long>(st.st_blocks) * 512 < onDisk &&
        !reserveRange(0, onDisk)) {
        int error = errno;
        env->closeFile(fd);
        fd = -1;
        logical = 0;
        allocated = 0;
        errno = error;
        return false;
    }
    return mapFile();
}

bool LinuxMmFile::size(unsigned int* result) {
    if (fd == -1 || name == nullptr) return false;
    struct stat st;
    if (Env::Current()->status(name, &st) != 0) return false;
    // A mapped file's sizes are 32-bit words; a longer file is not one of
    // ours and is refused rather than read as its size modulo 4 GiB.
    if (st.st_size < 0 || static_cast<unsigned long long>(st.st_size) > 0xFFFFFFFFull) return false;
    *result = static_cast<unsigned int>(st.st_size);
    return true;
}

long LinuxMmFile::tell() { return static_cast<long>(position); }

bool seekTarget(long offset, int origin, uint64_t position, uint64_t logical, long long* target) {
    long long to;
    switch (origin) {
        case SEEK_FROM_START: to = offset; break;
        case SEEK_FROM_CURRENT: to = static_cast<long long>(position) + offset; break;
        case SEEK_FROM_END: to = static_cast<long long>(logical) + offset; break;
        default: return false;
    }
    if (to < 0 || to > static_cast<long long>(logical)) return false;
    *target = to;
    return true;
}

bool LinuxMmFile::eof() { return eofFlag != 0; }

bool LinuxMmFile::seek(long offset, int origin) {
    eofFlag = 0;
    // Targets are computed wide so that no offset can wrap onto an accepted
    // position; every target outside 0..logical size is refused.
    long long target;
    if (!seekTarget(offset, origin, position, logical, &target)) return false;
    position = static_cast<uint32_t>(target);
    return true;
}

unsigned int LinuxMmFile::read(void* buffer, unsigned int length) {
    if (address == kUnmapped) {
        eofFlag = 1;
        return 0;
    }
    eofFlag = static_cast<unsigned long long>(position) + length > logical ? 1 : 0;
    uint32_t copied = 0;
    const char* from = view(position, length, &copied);
    if (copied != 0) std::memcpy(buffer, from, copied);
    position += copied;
    return copied;
}

const char* LinuxMmFile::view(uint32_t at, uint32_t length, uint32_t* got) {
    *got = 0;
    if (address == kUnmapped || at > logical) return nullptr;
    uint32_t n = static_cast<unsigned long long>(at) + length > logical ? logical - at : length;
    if (n != 0) {
        // Most reads stay inside the page of the last access, which has
        // nothing new to count.
        const unsigned int shift = pageShift();
        if ((at >> shift) != lastPage || ((static_cast<uint64_t>(at) + n - 1) >> shift) != lastPage)
            touched(at, n, true);
    }
    *got = n;
    return address + at;
}

unsigned int LinuxMmFile::write(void* buffer, unsigned int length) {
    if (static_cast<unsigned long long>(position) + length > logical) {
        if (!addChunk(length)) return 0;
    }
    if (address == kUnmapped) return 0;
    if (length != 0) {
        std::memcpy(address + position, buffer, length);
        written = true;
        touched(position, length, false);
    }
    position += length;
    return length;
}

// Growth.  The logical size moves in two ways, both relied upon:
//  - inside the allocated size it becomes position + length;
//  - after growing it becomes OLD logical size + length, even when the write
//    began before the end, so a straddling write leaves zeros behind its last
//    byte that count as content.
// Either way the disk space of the new content is reserved before the
// logical size moves, and a refusal leaves every size as it was.
bool LinuxMmFile::addChunk(unsigned int length) {
    if (static_cast<unsigned long long>(length) + logical <= allocated) {
        uint32_t newLogical = position + length;
        if (!reserveRange(reservedEnd(logical, allocated), reservedEnd(newLogical, allocated))) return false;
        logical = newLogical;
        return true;
    }
    if (!grow(length, static_cast<uint64_t>(logical) + length)) return false;
    logical += length;
    return true;
}

bool LinuxMmFile::reserve(unsigned int length) {
    if (fd == -1) {
        errno = EBADF;
        return false;
    }
    uint64_t end = static_cast<uint64_t>(logical) + length;
    if (end <= allocated) return reserveRange(reservedEnd(logical, allocated), reservedEnd(end, allocated));
    return grow(length, end);
}

bool LinuxMmFile::reserveRange(uint64_t from, uint64_t to) {
    if (to <= from) return true;
    int rc = reserveSpace(name, fd, from, to - from);
    if ((rc == ENOSPC || rc == EDQUOT) && rangeIsAllocated(fd, from, to)) rc = 0;
    if (rc == 0) {
        // The file's blocks changed; fallocate may also have moved its end.
        written = true;
        return true;
    }
    errno = rc;
    return false;
}

bool LinuxMmFile::grow(unsigned int length, uint64_t contentEnd) {
    // An allocation with nothing mapped is a file whose mapping failed: it
    // cannot be grown under it.
    if (address == kUnmapped && allocated != 0) return false;
    unsigned long long grown =
        static_cast<unsigned long long>(allocated) + CHUNK + (length & 0xFF000000u);
    // Past what a 32-bit size can describe, or, where `long` is 32 bits,
    // past what tell() and seek() can: the write fails instead of wrapping.
    const unsigned long long limit =
        sizeof(long) < 8 ? static_cast<unsigned long long>(LONG_MAX) : 0xFFFFFFFFull;
    if (grown > limit) {
        errno = EFBIG;
        return false;
    }
    uint32_t newAllocated = static_cast<uint32_t>(grown);
    // Space first, then the sparse extension to the new allocation (its one
    // written byte takes a block too), and only then the remapping: a full
    // disk refuses one of the first two and the old mapping stays in use.
    if (!reserveRange(reservedEnd(logical, allocated), reservedEnd(contentEnd, newAllocated))) return false;
    Env* env = Env::Current();
    char zero = 0;
    written = true;
    if (env->writeFileAt(fd, &zero, 1, static_cast<off_t>(newAllocated) - 1) != 1) return false;
    unMapFile();
    env->syncFile(fd);
    if (!mapFile()) return false;
    allocated = newAllocated;
    return true;
}

void LinuxMmFile::noteRead(uint32_t page) {
    if ((page >> 6) >= readMap.size()) return;
    uint64_t bit = 1ull << (page & 63);
    uint64_t& word = readMap[page >> 6];
    if (word & bit) return;
    word |= bit;
    ++readPages;
    if ((page >> 6) < droppedMap.size() && (droppedMap[page >> 6] & bit) != 0) ++refaultedPages;
}

bool LinuxMmFile::markPage(uint32_t page) {
    uint64_t bit = 1ull << (page & 63);
    uint64_t& word = touchedMap[page >> 6];
    if (word & bit) return false;
    word |= bit;
    ++touchedPages;
    return true;
}

void LinuxMmFile::touched(uint32_t from, unsigned int length, bool reading) {
    const unsigned int shift = pageShift();
    uint32_t first = from >> shift;
    uint32_t last = static_cast<uint32_t>((static_cast<uint64_t>(from) + length - 1) >> shift);
    if (first == lastPage && last == lastPage) return;
    // Accesses that move on from where the last one ended, or close behind
    // it, make a pass; any other jump ends it.
    if (lastPage != ~0u && first >= lastPage && first <= lastPage + kFaultAroundPages)
        passPages += last - lastPage;
    else if (lastPage != ~0u && last < lastFirstPage && last + kFaultAroundPages >= lastFirstPage)
        // The same downwards: blocks read from the end of a file back to
        // its start (an index's overflow slots, checked whole).
        passPages += lastFirstPage - first;
    else
        passPages = 0;
    lastPage = last;
    lastFirstPage = first;
    const uint64_t pages = static_cast<uint64_t>(touchedMap.size()) * 64;
    for (uint32_t page = first; page <= last && page < pages; ++page) {
        if (reading) noteRead(page);
        if (!markPage(page) || !reading) continue;
        // The read faults, and the fault maps the cached neighbours in its
        // aligned block too.
        uint32_t block = page & ~(kFaultAroundPages - 1);
        for (uint32_t other = block; other < block + kFaultAroundPages && other < pages; ++other) markPage(other);
    }
    const uint32_t baseBudget = (RESIDENT_BUDGET >> shift) != 0 ? RESIDENT_BUDGET >> shift : 1;
    if (budgetPages == 0) budgetPages = baseBudget;
    if (touchedPages <= baseBudget) return;
    // A pass over the file (a whole-index check after lookups at random, a
    // read-back after a build) keeps no more than the first budget, however
    // far lookups at random have raised the file's own.
    if (touchedPages <= budgetPages && passPages < baseBudget) return;
    // Most of what was touched since the last drop had been dropped before:
    // the file is read at random, and a drop would only bring the same
    // pages back through faults.  Let it keep more instead.
    // Only a file that is not being written grows: a build reads its own
    // rows back at random too, and its files grow without bound.
    if (!written && passPages < baseBudget && refaultedPages * 2 > readPages &&
        budgetPages < (RESIDENT_BUDGET_MAX >> shift)) {
        budgetPages *= 2;
        return;
    }
    // Called directly, not through Env: the advice changes neither the file
    // nor what a read returns, and its failure (the pages stay) is harmless,
    // so a wrapper has nothing to inject or observe here.
    ::madvise(address, mappedLength, MADV_DONTNEED);
    // Without room for the history the budget simply stays as it is.
    try {
        if (droppedMap.size() != readMap.size()) droppedMap.assign(readMap.size(), 0);
        for (size_t i = 0; i < readMap.size(); ++i) droppedMap[i] |= readMap[i];
    } catch (const std::bad_alloc&) {
        droppedMap.clear();
    }
    std::fill(touchedMap.begin(), touchedMap.end(), 0);
    std::fill(readMap.begin(), readMap.end(), 0);
    touchedPages = 0;
    readPages = 0;
    refaultedPages = 0;
    lastPage = ~0u;
}

bool LinuxMmFile::mapFile() {
    if (fd == -1) return false;
    if (address != kUnmapped) unMapFile();
    unsigned int onDisk = 0;
    if (!size(&onDisk)) return false;
    Env* env = Env::Current();
    mappedLength = 0;
    if (allocated > onDisk) {
        void* p = env->mapFile(nullptr, allocated, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        address = (p == MAP_FAILED) ? kUnmapped : static_cast<char*>(p);
        if (address != kUnmapped) mappedLength = allocated;
    }
    if (address == kUnmapped && onDisk != 0) {
        void* p = env->mapFile(nullptr, onDisk, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        address = (p == MAP_FAILED) ? kUnmapped : static_cast<char*>(p);
        if (address != kUnmapped) mappedLength = onDisk;
    }
    // A new mapping has nothing resident.  A failed allocation of the bits
    // leaves none, and then nothing is ever dropped: the file works as
    // before, only larger in memory.
    touchedPages = 0;
    readPages = 0;
    refaultedPages = 0;
    passPages = 0;
    lastPage = ~0u;
    touchedMap.clear();
    readMap.clear();
    droppedMap.clear();
    if (mappedLength != 0) {
        size_t pages = (mappedLength + (static_cast<size_t>(1) << pageShift()) - 1) >> pageShift();
        try {
            touchedMap.assign((pages + 63) / 64, 0);
            readMap.assign((pages + 63) / 64, 0);
        } catch (const std::bad_alloc&) {
            touchedMap.clear();
            readMap.clear();
        }
    }
    return address != kUnmapped;
}

bool LinuxMmFile::unMapFile() {
    if (address == kUnmapped) return false;
    Env* env = Env::Current();
    // A file this object has not changed has nothing to flush: syncing it
    // anyway costs a device flush per file at every read-only close.
    if (written) env->syncMapping(address, allocated, MS_SYNC);
    env->unmapFile(address, allocated);
    address = kUnmapped;
    if (written) env->syncFile(fd);
    return true;
}

bool LinuxMmFile::close() {
    if (fd == -1) return false;
    Env* env = Env::Current();
    unMapFile();
    // An unchanged file already has its logical size on disk; truncating it
    // anyway would dirty its inode and make the next sync of the device pay
    // for a file nobody wrote.
    if (written || logical != allocated) {
        if (env->truncateFile(fd, static_cast<off_t>(logical)) != 0) {
            // Nothing to report through: the result is the close's.
        }
    }
    if (env->closeFile(fd) != 0) return false;
    fd = -1;
    logical = 0;
    allocated = 0;
    position = 0;
    address = kUnmapped;
    eofFlag = 0;
    written = false;
    return true;
}
