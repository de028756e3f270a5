// Shared pieces of the fuzz targets: a private temporary directory per
// process (never the work tree), file writing and byte-to-text helpers.
//
// Every target keeps its files under one directory made by mkdtemp at the
// first call and removed at exit, and points the table lock files there too.
#ifndef FSCANNER_FUZZ_FUZZ_SUPPORT_H
#define FSCANNER_FUZZ_FUZZ_SUPPORT_H

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>

#include "fscanner/fscommon/sync.h"

namespace fuzzsupport {

inline void removeTree(std::string const& path) {
    DIR* dir = opendir(path.c_str());
    if (dir != nullptr) {
        while (struct dirent* entry = readdir(dir)) {
            if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) continue;
            std::string child = path + "/" + entry->d_name;
            struct stat st;
            if (lstat(child.c_str(), &st) == 0 && S_ISDIR(st.st_mode))
                removeTree(child);
            else
                unlink(child.c_str());
        }
        closedir(dir);
    }
    rmdir(path.c_str());
}

inline std::string& tempDirStorage() {
    static std::string dir;
    return dir;
}

inline void removeTempDirAtExit() {
    if (!tempDirStorage().empty()) removeTree(tempDirStorage());
}

// The process's own directory, with no final "/".  Lock files of tables go
// there as well.
inline std::string const& tempDir() {
    std::string& dir = tempDirStorage();
    if (dir.empty()) {
        const char* base = std::getenv("TMPDIR");
        std::string pattern = std::string(base != nullptr && *base != 0 ? base : "/tmp") + "/fscanner_fuzz_XXXXXX";
        char* made = mkdtemp(&pattern[0]);
        if (made == nullptr) std::abort();
        dir = made;
        LinuxSharedMutex::setStorePath((dir + "/").c_str());
        std::atexit(removeTempDirAtExit);
    }
    return dir;
}

inline std::wstring widen(std::string const& narrow) {
    return std::wstring(narrow.begin(), narrow.end());
}

// Writes bytes to path, replacing the file.  Aborts when it cannot: a fuzz
// run on a full disk says nothing about the readers.
inline void writeFile(std::string const& path, uint8_t const* data, size_t size) {
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (fd < 0) std::abort();
    size_t done = 0;
    while (done < size) {
        ssize_t n = write(fd, data + done, size - done);
        if (n <= 0) std::abort();
        done += static_cast<size_t>(n);
    }
    close(fd);
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
