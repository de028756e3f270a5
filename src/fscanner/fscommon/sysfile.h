// Positional file interface of the record store and the result files.
//
// All sizes and positions are 32-bit.  Seek origins are this interface's own
// numbers, not the platform's: SEEK_FROM_START 1, SEEK_FROM_CURRENT 2,
// SEEK_FROM_END 3.  Objects come from SysFactory and belong to whoever asked
// for them.  No operation traces, keeps an error code or passes errno on: the
// bool or the byte count is the whole report.  One object serves one thread
// at a time; exclusion between processes is the business of the locks held by
// the owner of the file.  One exception to the errno rule: a LinuxMmFile
// operation refused because the disk cannot hold the file leaves errno at the
// system's reason (ENOSPC, EDQUOT, EFBIG, ...), for the caller to report.
#ifndef FSCANNER_FSCOMMON_SYSFILE_H
#define FSCANNER_FSCOMMON_SYSFILE_H

#include <cstdint>
#include <cstdio>
#include <typeinfo>
#include <vector>

const int SEEK_FROM_START = 1;
const int SEEK_FROM_CURRENT = 2;
const int SEEK_FROM_END = 3;

// The position seek(offset, origin) asks for on content of logical bytes read
// at position, computed wide so that no offset can wrap onto an accepted
// position.  False for an unknown origin or a target outside 0..logical.
bool seekTarget(long offset, int origin, uint64_t position, uint64_t logical, long long* target);

class AbstractFile {
public:
    virtual ~AbstractFile() {}
    // Creates the named file anew (an existing one is replaced) and opens it
    // for reading and writing.  False when there is no name or it fails.
    virtual bool create() = 0;
    // Opens an existing file for reading and writing; false when it is missing.
    virtual bool open() = 0;
    // Closes the file; false when none is open.  The object may be reopened.
    virtual bool close() = 0;
    // Copies up to length bytes into buffer at the current position; returns
    // the bytes transferred and advances by them.
    virtual unsigned int read(void* buffer, unsigned int length) = 0;
    // Copies length bytes from buffer at the current position; returns the
    // bytes transferred and advances by them.
    virtual unsigned int write(void* buffer, unsigned int length) = 0;
    // Moves the position; origin 1 start, 2 current, 3 end.  False for another
    // origin or a refused target.
    virtual bool seek(long offset, int origin) = 0;
    virtual long tell() = 0;
    // True after a read that reached the end of the content.
    virtual bool eof() = 0;
    // Stores the file's size in *result; false when it cannot be learnt.
    virtual bool size(unsigned int* result) = 0;
};

class AbstractStdFile : public AbstractFile {};
class AbstractMmFile : public AbstractFile {};

// Buffered file on stdio.  read and write assume an open stream: calling them
// on a closed object is the caller's error.
class StdFile : public AbstractStdFile {
public:
    // Copies name (kelm_malloc); null leaves the object nameless, and then
    // create and open fail.
    explicit StdFile(wchar_t const* name);
    ~StdFile() override;

    bool create() override;
    bool open() override;
    bool close() override;
    unsigned int read(void* buffer, unsigned int length) override;
    unsigned int write(void* buffer, unsigned int length) override;
    // Returns true for origins 1..3 on an open stream whatever fseek says.
    bool seek(long offset, int origin) override;
    long tell() override;
    bool eof() override;
    bool size(unsigned int* result) override;

private:
    StdFile(const StdFile&) = delete;
    StdFile& operator=(const StdFile&) = delete;
    bool openMode(const char* mode);

    FILE* stream;
    wchar_t* name;
};

// Memory-mapped file that grows by LinuxMmFile::CHUNK (16 MiB) at a time.
//
// The file on disk is extended ahead of the content ("allocated size"); the
// content that counts is the "logical size".  close() truncates the file to
// the logical size.  A process that dies with the file open leaves it at the
// allocated size, zeros behind the last written byte; opening it again makes
// the padding content.  The mapping is shared, so written bytes reach the file
// without close().
//
// A store through a mapping into a part of the file that the disk cannot
// back kills the process with SIGBUS, so no byte is ever copied into the
// mapping before its disk space is reserved: the allocated size is a sparse
// extension, and the space is reserved in RESERVE_STEP steps just ahead of
// the logical size (every byte below the logical size rounded up to the step,
// but not past the allocated size, is backed; open() backs the holes of a
// file that has any).  The step is a page for a small file and grows with
// the content, a 32nd of it up to RESERVE_STEP_MAX.  A full disk thus
// refuses the write (0 bytes, errno set) and leaves the file as it was,
// still mapped.
//
// Resident pages: every page of the mapping that a read or write touched
// stays in the process's resident set until it is unmapped, so a pass over a
// large table would hold the whole file resident.  The object keeps a bit
// per page that an access made resident (with the neighbours a read fault
// maps along); once these pass RESIDENT_BUDGET, it lets go of the whole
// mapping's pages (MADV_DONTNEED) and starts counting anew.  A small set of
// pages used again and again (an index's buckets) counts once.  A file read
// at random (the directories table while paths are rebuilt) would fault the
// same pages back after every drop: when more than half of the pages read
// since the last drop had been read and dropped before, the file's budget doubles
// instead, up to RESIDENT_BUDGET_MAX, so a working set that fits stays; a
// pass over the file, and a file being written, are still held to the first
// budget.  On a shared
// file mapping that drops only the process's page table entries: written
// bytes stay in the page cache, dirty, and reach the file as before; the
// next access faults the page back in from the cache.  Nothing on disk, and
// no sync, changes.
class LinuxMmFile : public AbstractMmFile {
public:
    static const uint32_t CHUNK = 0x1000000;
    // Smallest granule of the disk space reservation: a page, the unit in
    // which a store through the mapping dirties the file anyway.  Reserving
    // further ahead of a small file would make a cache that fits fail on a
    // small file system; one reservation call still serves many record
    // writes.
    static const uint32_t RESERVE_STEP = 0x1000;
    // Largest granule: a large file reserves a 32nd of its content ahead,
    // but never more than this, so that a file that has grown large does not
    // pay a reservation call per page, and the space it holds beyond its
    // content until close stays small beside it.
    static const uint32_t RESERVE_STEP_MAX = 0x100000;
    // Bytes of touched pages a mapping may hold resident before they are
    // dropped (see above).  Small beside the files, large beside a page: a
    // pass faults each page once either way, and a drop costs one call per
    // this many bytes.
    static const uint32_t RESIDENT_BUDGET = 0x200000;
    // Largest budget a file read at random grows to (see above).
    static const uint32_t RESIDENT_BUDGET_MAX = 0x1000000;

    // Copies name (kelm_malloc); null leaves the object nameless.
    explicit LinuxMmFile(char const* name);
    // close(), then frees the name.
    ~LinuxMmFile() override;

    // Unlinks the name, opens it anew (0660); nothing mapped or allocated yet.
    bool create() override;
    // Opens an existing file and maps it; an empty file stays unmapped.  A
    // descriptor opened here stays open when mapping fails.  A file with
    // holes (left by a crash, or by a writer that did not reserve) has them
    // backed first; when the disk cannot, the open fails, closed again.
    bool open() override;
    // Unmaps, truncates to the logical size, closes.  On a failed close the
    // object keeps its state and returns false.  A file that was only read
    // is neither synced nor truncated: it is on disk as it was opened.
    bool close() override;
    // Nothing mapped: 0 and the end flag set.  A read past the logical size
    // copies what remains and sets the flag; a full read clears it.
    unsigned int read(void* buffer, unsigned int length) override;
    // Grows the file (addChunk) when the write passes the logical size;
    // returns length, or 0 when growth, the disk space or the mapping is
    // missing.  No short write: a refused write changes nothing.
    unsigned int write(void* buffer, unsigned int length) override;
    // Clears the end flag always; never moves past the logical size.
    bool seek(long offset, int origin) override;
    long tell() override;
    bool eof() override;
    // Size ON DISK of the named file (the allocated size while it is open).
    bool size(unsigned int* result) override;

    // Growth step; see the .cpp for the two ways the logical size moves.
    // False, with the file as it was (and still mapped), when the disk space
    // cannot be reserved or the file would pass what a 32-bit size holds.
    bool addChunk(unsigned int length);
    // Makes room for length more bytes behind the content: grows the file as
    // a write of length bytes at the end would and reserves the disk space,
    // leaving the content, the position and the end flag alone.  After true,
    // such a write cannot fail for want of space, which lets a caller that
    // writes one logical record in several files check them all before it
    // writes any.  False, errno set and the file as it was, otherwise.
    bool reserve(unsigned int length);
    // (Re)maps the file: the allocated size when that is larger than the size
    // on disk, else the size on disk.
    bool mapFile();
    // msync + munmap of the allocated size, then fsync; false when unmapped.
    // The two syncs are left out for a file this object has not changed
    // since it was opened or created.
    bool unMapFile();

    // Observers for callers that need the two sizes (tests, diagnostics).
    uint32_t logicalSize() const { return logical; }
    uint32_t allocatedSize() const { return allocated; }
    bool isOpen() const { return fd != -1; }
    // The bytes [at, at + length) in place, cut at the logical end (*got of
    // them), as read() would copy them and counted as read; null with *got 0
    // when nothing is mapped.  Valid until the next write, close or
    // remapping; the position is left alone.
    const char* view(uint32_t at, uint32_t length, uint32_t* got);

private:
    LinuxMmFile(const LinuxMmFile&) = delete;
    LinuxMmFile& operator=(const LinuxMmFile&) = delete;

    // Backs the bytes [from, to) with disk space; true for an empty range.
    // False with errno set to the reason.
    bool reserveRange(uint64_t from, uint64_t to);
    // Grows the allocation for a write of length bytes at the end of the
    // content whose bytes reach contentEnd, reserving up to there; the
    // logical size is the caller's to move.
    bool grow(unsigned int length, uint64_t contentEnd);
    // Marks the pages that an access of length bytes at from makes resident
    // and drops the mapping's resident pages once they pass the budget.
    void touched(uint32_t from, unsigned int length, bool reading);
    // Sets the page's bit; true when it was clear.
    bool markPage(uint32_t page);
    // Notes a page read since the last drop, and whether it had been read
    // and dropped before.
    void noteRead(uint32_t page);

    int32_t fd;
    uint32_t logical;
    uint32_t allocated;
    uint32_t position;
    char* address;  // (char*)-1 when nothing is mapped
    char eofFlag;
    char* name;
    // Set by the first change to the file (a byte written, space reserved,
    // growth) since it was opened or created: only such a file is synced
    // and truncated at close.
    bool written;
    // One bit per page of the mapping, set when an access may have made it
    // resident since the mapping was made or last dropped (an upper bound);
    // touchedPages counts the set bits.  lastPage is the page of the last
    // access (where it ended; lastFirstPage where it began): most accesses
    // stay in it and need no look at the bits.
    std::vector<uint64_t> touchedMap;
    uint32_t touchedPages;
    uint32_t lastPage;
    uint32_t lastFirstPage;
    // Pages the current pass has moved over (accesses each starting where
    // the last ended or just behind it, or each ending just below where the
    // last began); 0 after any other jump.
    uint32_t passPages;
    // Pages read since the last drop (readPages of them), pages read and
    // then dropped at some earlier drop of this mapping, how many of the
    // pages read since the last drop are among those, and the budget in
    // pages (0 until the first access sets it from the page size).  Writes
    // do not count: a table written and then read back in one pass must not
    // look like a file read at random.
    std::vector<uint64_t> readMap;
    uint32_t readPages;
    std::vector<uint64_t> droppedMap;
    uint32_t refaultedPages;
    uint32_t budgetPages;
    size_t mappedLength;  // bytes of the current mapping, 0 when none
};

// file as a LinuxMmFile when it is one (and no class derived from it), else
// null: the table's readers take the bytes of such a file in place, through
// view, where a seek and a copying read would cost more than the bytes.
inline LinuxMmFile* exactlyMapped(AbstractFile* file) {
    return file != nullptr && typeid(*file) == typeid(LinuxMmFile) ? static_cast<LinuxMmFile*>(file) : nullptr;
}

// The bytes [at, at + length) of file in place, counted as read, when it is
// such a mapped file and holds them all; null otherwise, for the caller to
// read them the usual way.
inline const char* mappedBytes(AbstractFile* file, uint64_t at, uint32_t length) {
    LinuxMmFile* mapped = exactlyMapped(file);
    if (mapped == nullptr || at + length > 0x7FFFFFFFull) return nullptr;
    uint32_t got = 0;
    const char* bytes = mapped->view(static_cast<uint32_t>(at), length, &got);
    return bytes != nullptr && got == length ? bytes : nullptr;
}

#endif
