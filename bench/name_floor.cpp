// How fast the names of a cache's files table can be read at all: a pass over
// the pointer file and the data file, mapped read-only, that takes each live
// record's FILENAME (the first column) straight from the bytes and tests it
// for a suffix.  No cursor, no integrity check, no path, no output: the floor
// under a served wildcard query that the table format itself sets.
//
//   cmake --build build --target name_floor
//   build/name_floor CACHE_DIR/all SUFFIX [ROUNDS]
//
// Reads files.pxx and files.dat of the directory (the layout is the one
// table_format.h states; integers plain or in 7-bit groups, told apart by the
// first record's length against the second slot).  Prints, per round, the
// pass's time in milliseconds, the records and the names that end in SUFFIX;
// then the median.  The first round maps the pages in, as a query does.  The
// benchmark of record is bench/fsquery_bench.sh; this only bounds what a scan
// of this format could reach.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace {

struct Mapped {
    const unsigned char* data = nullptr;
    size_t size = 0;
};

bool mapFile(const std::string& path, Mapped* out) {
    int fd = open(path.c_str(), O_RDONLY);
    if (fd < 0) return false;
    struct stat st;
    if (fstat(fd, &st) != 0 || st.st_size == 0) {
        close(fd);
        return false;
    }
    void* p = mmap(nullptr, static_cast<size_t>(st.st_size), PROT_READ, MAP_SHARED, fd, 0);
    close(fd);
    if (p == MAP_FAILED) return false;
    out->data = static_cast<const unsigned char*>(p);
    out->size = static_cast<size_t>(st.st_size);
    return true;
}

uint32_t word(const unsigned char* at) {
    uint32_t v;
    std::memcpy(&v, at, 4);
    return v;
}

// A 7-bit group number at at (codec.h: most significant group first, the
// group in bits 7..1, bit 0 set when another byte follows); advances.
uint32_t groups(const unsigned char*& at, const unsigned char* end) {
    uint32_t v = 0;
    for (int n = 0; at < end && n < 5; ++n) {
        unsigned char b = *at++;
        v = (v << 7) | (b >> 1);
        if ((b & 1) == 0) break;
    }
    return v;
}

// The FILENAME bytes of the record at offset: 1 byte of presence bits (the
// table has 7 columns), then the text's length and bytes.
bool nameAt(const Mapped& dat, uint32_t offset, bool compressed, const unsigned char** name, uint32_t* length) {
    const unsigned char* end = dat.data + dat.size;
    const unsigned char* at = dat.data + offset + 1;
    if (at + 2 > end) return false;
    if (compressed) {
        *length = groups(at, end);
    } else {
        uint16_t n;
        std::memcpy(&n, at, 2);
        *length = n;
        at += 2;
    }
    if (at + *length > end) return false;
    *name = at;
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 3) {
        std::fprintf(stderr, "usage: name_floor CACHE_DIR/all SUFFIX [ROUNDS]\n");
        return 2;
    }
    std::string dir = argv[1];
    std::string suffix = argv[2];
    int rounds = argc > 3 ? std::atoi(argv[3]) : 7;
    Mapped pxx, dat;
    if (!mapFile(dir + "/files.pxx", &pxx) || !mapFile(dir + "/files.dat", &dat)) {
        std::fprintf(stderr, "name_floor: cannot map files.pxx and files.dat in %s\n", dir.c_str());
        return 1;
    }
    const uint32_t slots = static_cast<uint32_t>(pxx.size / 4);
    // Plain or 7-bit groups: the plain reading of record 0's name must end
    // where its later columns can still fit before record 1.
    bool compressed = false;
    if (slots > 1 && word(pxx.data) != 0 && word(pxx.data + 4) != 0) {
        const unsigned char* name;
        uint32_t length;
        uint32_t next = word(pxx.data + 4);
        compressed = !nameAt(dat, word(pxx.data), false, &name, &length) ||
                     static_cast<uint32_t>(name - dat.data) + length > next;
    }
    std::vector<double> times;
    for (int r = 0; r < rounds; ++r) {
        auto start = std::chrono::steady_clock::now();
        uint32_t live = 0, hits = 0;
        for (uint32_t s = 0; s < slots; ++s) {
            uint32_t offset = word(pxx.data + static_cast<size_t>(s) * 4);
            if (offset == 0 || offset >= dat.size) continue;
            const unsigned char* name;
            uint32_t length;
            if (!nameAt(dat, offset, compressed, &name, &length)) continue;
            ++live;
            if (length >= suffix.size() &&
                std::memcmp(name + length - suffix.size(), suffix.data(), suffix.size()) == 0)
                ++hits;
        }
        double ms = std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
        times.push_back(ms);
        std::printf("round %d: %.2f ms, %u records, %u names end in '%s'%s\n", r + 1, ms, live, hits,
                    suffix.c_str(), compressed ? " (7-bit groups)" : "");
    }
    std::sort(times.begin(), times.end());
    std::printf("median %.2f ms over %d rounds\n", times[times.size() / 2], rounds);
    return 0;
}
