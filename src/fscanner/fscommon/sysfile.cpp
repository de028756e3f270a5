#include "fscanner/fscommon/sysfile.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <cstring>
#include <cwchar>

#include "base/kelmem.h"

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
    if (stream != nullptr) fclose(stream);  // reopening must not leak the old stream
    stream = fopen(narrow, mode);
    return stream != nullptr;
}

bool StdFile::create() { return openMode("w+b"); }

bool StdFile::open() { return openMode("r+b"); }

bool StdFile::close() {
    if (stream == nullptr) return false;
    fclose(stream);
    stream = nullptr;
    return true;
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
    : fd(-1), logical(0), allocated(0), position(0), address(kUnmapped), eofFlag(0), name(nullptr) {
    if (fileName != nullptr) name = i_strdup(fileName);
}

LinuxMmFile::~LinuxMmFile() {
    close();
    kelm_free(name);
}

bool LinuxMmFile::create() {
    if (name == nullptr || fd != -1) return false;
    unlink(name);
    int d = ::open(name, O_RDWR | O_CREAT | O_TRUNC | O_NONBLOCK, 0660);
    if (d == -1) return false;
    fd = d;
    logical = 0;
    allocated = 0;
    position = 0;
    eofFlag = 0;
    return true;
}

bool LinuxMmFile::open() {
    if (name == nullptr || fd != -1) return false;
    int d = ::open(name, O_RDWR | O_NONBLOCK, 0660);
    if (d == -1) return false;
    fd = d;
    unsigned int onDisk = 0;
    if (!size(&onDisk)) {
        // Not one of ours (too long to describe): left as it is, not cut to
        // a logical size of 0 by a later close.
        ::close(fd);
        fd = -1;
        return false;
    }
    logical = onDisk;
    allocated = onDisk;
    position = 0;
    eofFlag = 0;
    if (onDisk == 0) return true;
    return mapFile();
}

bool LinuxMmFile::size(unsigned int* result) {
    if (fd == -1 || name == nullptr) return false;
    struct stat st;
    if (stat(name, &st) != 0) return false;
    // A mapped file's sizes are 32-bit words; a longer file is not one of
    // ours and is refused rather than read as its size modulo 4 GiB.
    if (st.st_size < 0 || static_cast<unsigned long long>(st.st_size) > 0xFFFFFFFFull) return false;
    *result = static_cast<unsigned int>(st.st_size);
    return true;
}

long LinuxMmFile::tell() { return static_cast<long>(position); }

bool LinuxMmFile::eof() { return eofFlag != 0; }

bool LinuxMmFile::seek(long offset, int origin) {
    eofFlag = 0;
    // Targets are computed wide so that no offset can wrap onto an accepted
    // position; every target outside 0..logical size is refused.
    long long target;
    switch (origin) {
        case SEEK_FROM_START: target = offset; break;
        case SEEK_FROM_CURRENT: target = static_cast<long long>(position) + offset; break;
        case SEEK_FROM_END: target = static_cast<long long>(logical) + offset; break;
        default: return false;
    }
    if (target < 0 || target > static_cast<long long>(logical)) return false;
    position = static_cast<uint32_t>(target);
    return true;
}

unsigned int LinuxMmFile::read(void* buffer, unsigned int length) {
    if (address == kUnmapped) {
        eofFlag = 1;
        return 0;
    }
    unsigned int copied;
    if (static_cast<unsigned long long>(position) + length > logical) {
        copied = logical - position;
        eofFlag = 1;
    } else {
        copied = length;
        eofFlag = 0;
    }
    if (copied != 0) std::memcpy(buffer, address + position, copied);
    position += copied;
    return copied;
}

unsigned int LinuxMmFile::write(void* buffer, unsigned int length) {
    if (static_cast<unsigned long long>(position) + length > logical) {
        if (!addChunk(length)) return 0;
    }
    if (address == kUnmapped) return 0;
    if (length != 0) std::memcpy(address + position, buffer, length);
    position += length;
    return length;
}

// Growth.  The logical size moves in two ways, both relied upon:
//  - inside the allocated size it becomes position + length;
//  - after growing it becomes OLD logical size + length, even when the write
//    began before the end, so a straddling write leaves zeros behind its last
//    byte that count as content.
bool LinuxMmFile::addChunk(unsigned int length) {
    if (static_cast<unsigned long long>(length) + logical <= allocated) {
        logical = position + length;
        return true;
    }
    if (!unMapFile() && allocated != 0) return false;
    unsigned long long grown =
        static_cast<unsigned long long>(allocated) + CHUNK + (length & 0xFF000000u);
    // Past what a 32-bit size can describe, or, where `long` is 32 bits,
    // past what tell() and seek() can: the write fails instead of wrapping.
    const unsigned long long limit =
        sizeof(long) < 8 ? static_cast<unsigned long long>(LONG_MAX) : 0xFFFFFFFFull;
    if (grown > limit) return false;
    uint32_t newAllocated = static_cast<uint32_t>(grown);
    if (lseek(fd, static_cast<off_t>(newAllocated) - 1, SEEK_SET) == static_cast<off_t>(-1)) return false;
    char zero = 0;
    if (::write(fd, &zero, 1) != 1) return false;
    fsync(fd);
    if (!mapFile()) return false;
    logical += length;
    allocated = newAllocated;
    return true;
}

bool LinuxMmFile::mapFile() {
    if (fd == -1) return false;
    if (address != kUnmapped) unMapFile();
    unsigned int onDisk = 0;
    if (!size(&onDisk)) return false;
    if (allocated > onDisk) {
        void* p = mmap(nullptr, allocated, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        address = (p == MAP_FAILED) ? kUnmapped : static_cast<char*>(p);
    }
    if (address == kUnmapped && onDisk != 0) {
        void* p = mmap(nullptr, onDisk, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
        address = (p == MAP_FAILED) ? kUnmapped : static_cast<char*>(p);
    }
    return address != kUnmapped;
}

bool LinuxMmFile::unMapFile() {
    if (address == kUnmapped) return false;
    msync(address, allocated, MS_SYNC);
    munmap(address, allocated);
    address = kUnmapped;
    fsync(fd);
    return true;
}

bool LinuxMmFile::close() {
    if (fd == -1) return false;
    unMapFile();
    if (ftruncate(fd, static_cast<off_t>(logical)) != 0) {
        // Nothing to report through: the result is the close's.
    }
    if (::close(fd) != 0) return false;
    fd = -1;
    logical = 0;
    allocated = 0;
    position = 0;
    address = kUnmapped;
    eofFlag = 0;
    return true;
}
