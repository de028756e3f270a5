// Shared pieces of the fuzz targets, on top of the test support: a private
// temporary directory per process (never the work tree), file writing that
// aborts on failure, and a reader of the fuzzer's bytes.
//
// Every target keeps its files under one directory made at the first call
// and removed at exit, and points the table lock files there too.
#ifndef FSCANNER_FUZZ_FUZZ_SUPPORT_H
#define FSCANNER_FUZZ_FUZZ_SUPPORT_H

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace fuzzsupport {

// The process's own directory, with no final "/", removed at exit with what
// it holds.  Lock files of tables go there as well.
inline std::string const& tempDir() {
    static testsupport::TempDir* dir = nullptr;
    static std::string path;
    if (dir == nullptr) {
        dir = new testsupport::TempDir();
        path = dir->path();
        LinuxSharedMutex::setStorePath((path + "/").c_str());
        std::atexit([] { delete dir; });
    }
    return path;
}

using testsupport::widen;

// Writes bytes to path, replacing the file.  Aborts when it cannot: a fuzz
// run on a full disk says nothing about the readers.
inline void writeFile(std::string const& path, uint8_t const* data, size_t size) {
    if (!testsupport::writeBytes(path, data, size)) std::abort();
}

inline void writeFile(std::string const& path, std::string const& bytes) {
    writeFile(path, reinterpret_cast<uint8_t const*>(bytes.data()), bytes.size());
}

// Reads input in order; past the end every read gives zeros.
class ByteReader {
public:
    ByteReader(uint8_t const* data, size_t size) : data_(data), size_(size), pos_(0) {}
    uint8_t byte() { return pos_ < size_ ? data_[pos_++] : 0; }
    uint16_t word16() {
        uint16_t lo = byte();
        return static_cast<uint16_t>(lo | (byte() << 8));
    }
    uint32_t word32() {
        uint32_t v = word16();
        return v | (static_cast<uint32_t>(word16()) << 16);
    }
    // Up to n bytes (fewer at the end).
    std::string take(size_t n) {
        size_t left = size_ - pos_;
        if (n > left) n = left;
        std::string out(reinterpret_cast<char const*>(data_ + pos_), n);
        pos_ += n;
        return out;
    }
    std::string rest() { return take(size_ - pos_); }
    size_t left() const { return size_ - pos_; }

private:
    uint8_t const* data_;
    size_t size_;
    size_t pos_;
};

}  // namespace fuzzsupport

#endif
