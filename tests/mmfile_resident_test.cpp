// What a mapped file costs the process in memory and on disk while it is
// open: the pages a pass touched do not all stay resident, and the disk
// space reserved ahead of the content stays close to the content.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "fscanner/fscommon/sysfile.h"
#include "support/testsupport.h"

namespace {

using testsupport::TempDir;

// Resident file-backed and shared pages of this process in KiB, from
// /proc/self/status; -1 where the kernel does not split the resident set.
long long residentFileKib() {
    std::ifstream status("/proc/self/status");
    std::string line;
    long long total = 0;
    bool found = false;
    while (std::getline(status, line)) {
        if (line.compare(0, 8, "RssFile:") == 0 || line.compare(0, 9, "RssShmem:") == 0) {
            total += std::stoll(line.substr(line.find(':') + 1));
            found = true;
        }
    }
    return found ? total : -1;
}

// The byte at offset of the test pattern: no page repeats another.
unsigned char patternAt(uint32_t offset) {
    return static_cast<unsigned char>((offset * 2654435761u) >> 24);
}

const uint32_t kPiece = 64 * 1024;
const uint32_t kFileBytes = 48u << 20;
// Four times the file's budget, a sixth of the file: a file that kept every
// touched page would pass it within each 16 MiB growth step while writing,
// and six times over while reading.
const long long kResidentLimitKib = 8 * 1024;

TEST(MmFileResident, WritingAndReadingALargeFileKeepsFewPagesResident) {
    if (residentFileKib() < 0) GTEST_SKIP() << "no RssFile line in /proc/self/status";
    TempDir dir;
    std::string path = dir.file("large.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::vector<unsigned char> piece(kPiece);
    long long before = residentFileKib();
    long long most = 0;
    for (uint32_t at = 0; at < kFileBytes; at += kPiece) {
        for (uint32_t k = 0; k < kPiece; ++k) piece[k] = patternAt(at + k);
        ASSERT_EQ(kPiece, f.write(piece.data(), kPiece)) << "at " << at;
        if (at % (1u << 20) == 0) most = std::max(most, residentFileKib() - before);
    }
    EXPECT_LT(most, kResidentLimitKib) << "while writing";

    ASSERT_TRUE(f.seek(0, SEEK_FROM_START));
    before = residentFileKib();
    most = 0;
    for (uint32_t at = 0; at < kFileBytes; at += kPiece) {
        ASSERT_EQ(kPiece, f.read(piece.data(), kPiece)) << "at " << at;
        for (uint32_t k = 0; k < kPiece; ++k) ASSERT_EQ(patternAt(at + k), piece[k]) << "at " << at + k;
        if (at % (1u << 20) == 0) most = std::max(most, residentFileKib() - before);
    }
    EXPECT_LT(most, kResidentLimitKib) << "while reading";
    EXPECT_TRUE(f.close());

    // Pages let go of while dirty still reach the file.
    std::ifstream in(path, std::ios::binary);
    for (uint32_t at = 0; at < kFileBytes; at += kPiece) {
        ASSERT_TRUE(in.read(reinterpret_cast<char*>(piece.data()), kPiece)) << "at " << at;
        for (uint32_t k = 0; k < kPiece; ++k) ASSERT_EQ(patternAt(at + k), piece[k]) << "at " << at + k;
    }
    EXPECT_EQ(EOF, in.get());
}

TEST(MmFileResident, PagesWrittenAgainAfterADropKeepTheLastBytes) {
    // A header rewritten between appends (as a table's counts are) must end
    // with its last value whether or not its page was dropped in between.
    TempDir dir;
    std::string path = dir.file("header.bin");
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::vector<unsigned char> piece(kPiece, 0x5A);
    for (uint32_t n = 0; n < 256; ++n) {  // 16 MiB of appends
        ASSERT_TRUE(f.seek(0, SEEK_FROM_END));
        ASSERT_EQ(kPiece, f.write(piece.data(), kPiece));
        ASSERT_TRUE(f.seek(0, SEEK_FROM_START));
        uint32_t count = n + 1;
        ASSERT_EQ(4u, f.write(&count, 4));
    }
    EXPECT_TRUE(f.close());
    std::string bytes = testsupport::readFile(path);
    ASSERT_EQ(256u * kPiece, bytes.size());
    uint32_t count = 0;
    std::memcpy(&count, bytes.data(), 4);
    EXPECT_EQ(256u, count);
    EXPECT_EQ(std::string(kPiece - 4, '\x5A'), bytes.substr(4, kPiece - 4));
    EXPECT_EQ('\x5A', bytes.back());
}

TEST(MmFileResident, DiskSpaceIsReservedAheadOfTheContentButNotFarAhead) {
    TempDir dir;
    std::string path = dir.file("reserved.bin");
    // A file system without holes backs every byte of the allocation at
    // once: nothing to learn about the reservation there.
    {
        std::string probe = dir.file("probe.bin");
        std::ofstream(probe) << "x";
        ASSERT_EQ(0, truncate(probe.c_str(), 1 << 20));
        struct stat st;
        ASSERT_EQ(0, stat(probe.c_str(), &st));
        if (static_cast<long long>(st.st_blocks) * 512 >= (1 << 20)) {
            GTEST_SKIP() << "the temporary directory's file system keeps no holes";
        }
    }
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::vector<unsigned char> record(1000, 0x33);
    for (int n = 1; n <= 8000; ++n) {  // 8 MB in records of 1000 bytes
        ASSERT_EQ(1000u, f.write(record.data(), 1000));
        if (n % 97 != 0 && n != 8000) continue;
        struct stat st;
        ASSERT_EQ(0, stat(path.c_str(), &st));
        long long backed = static_cast<long long>(st.st_blocks) * 512;
        long long content = f.logicalSize();
        // Every page of the content is backed ...
        EXPECT_GE(backed, content / 4096 * 4096) << "after " << content << " bytes";
        // ... and beyond it at most a 32nd of it, or a page for a small file,
        // besides the block of the sparse extension's last byte and room for
        // the file system's own blocks.
        long long ahead = content / 32 > 4096 ? content / 32 : 4096;
        EXPECT_LE(backed, content + ahead + 4096 + 64 * 1024) << "after " << content << " bytes";
    }
    EXPECT_TRUE(f.close());
    EXPECT_EQ(8000u * 1000u, testsupport::readFile(path).size());
}

}  // namespace

// Minor faults of this process so far.
long long minorFaults() {
    struct rusage usage;
    getrusage(RUSAGE_SELF, &usage);
    return usage.ru_minflt;
}

// A new file of bytes (a multiple of kPiece) holding the test pattern.
void writePatternFile(const std::string& path, uint32_t bytes) {
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.create());
    std::vector<unsigned char> piece(kPiece);
    for (uint32_t at = 0; at < bytes; at += kPiece) {
        for (uint32_t k = 0; k < kPiece; ++k) piece[k] = patternAt(at + k);
        ASSERT_EQ(kPiece, f.write(piece.data(), kPiece));
    }
    ASSERT_TRUE(f.close());
}

// count reads of 8 bytes at places drawn from seed inside the first span
// bytes of f, each checked against the pattern.
void readAtRandom(LinuxMmFile& f, uint32_t span, uint32_t count, uint32_t* seed) {
    for (uint32_t i = 0; i < count; ++i) {
        *seed = *seed * 1103515245u + 12345u;
        uint32_t at = (*seed >> 4) % (span - 8);
        unsigned char value[8];
        ASSERT_TRUE(f.seek(static_cast<long>(at), SEEK_FROM_START));
        ASSERT_EQ(8u, f.read(value, 8));
        ASSERT_EQ(patternAt(at), value[0]) << "at " << at;
    }
}

TEST(MmFileResident, AFileReadAtRandomKeepsItsWorkingSetInsteadOfFaultingItBack) {
    // 12 MiB, six times the first budget and inside the largest one: read at
    // random, the pages would come back by faults after every drop.
    const uint32_t bytes = 12u << 20;
    TempDir dir;
    std::string path = dir.file("random.bin");
    ASSERT_NO_FATAL_FAILURE(writePatternFile(path, bytes));
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.open());
    const uint32_t pages = bytes / 4096;
    uint32_t seed = 12345;
    long long lastRoundFaults = 0;
    for (int round = 0; round < 6; ++round) {
        long long before = minorFaults();
        ASSERT_NO_FATAL_FAILURE(readAtRandom(f, bytes, pages, &seed));
        lastRoundFaults = minorFaults() - before;
    }
    // Dropping everything at each budget would fault a good part of the
    // file back every round; kept, the last round faults next to nothing.
    EXPECT_LT(lastRoundFaults, static_cast<long long>(pages / 16));
    EXPECT_TRUE(f.close());
}

TEST(MmFileResident, APassDownwardsKeepsTheFirstBudgetAfterReadsAtRandom) {
    // Reads at random raise the file's budget toward its largest; a pass in
    // blocks from the end back to the start (an index checked whole) must
    // still be held to the first budget, as a pass upwards is.
    if (residentFileKib() < 0) GTEST_SKIP() << "no RssFile line in /proc/self/status";
    const uint32_t bytes = 32u << 20;
    TempDir dir;
    std::string path = dir.file("downwards.bin");
    ASSERT_NO_FATAL_FAILURE(writePatternFile(path, bytes));
    LinuxMmFile f(path.c_str());
    ASSERT_TRUE(f.open());
    long long before = residentFileKib();
    // Reads at random over the first 12 MiB, as the growth test does.
    uint32_t seed = 777;
    for (int round = 0; round < 6; ++round)
        ASSERT_NO_FATAL_FAILURE(readAtRandom(f, 12u << 20, (12u << 20) / 4096, &seed));
    long long most = 0;
    std::vector<unsigned char> piece(kPiece);
    for (uint32_t end = bytes; end > 0; end -= kPiece) {
        uint32_t at = end - kPiece;
        ASSERT_TRUE(f.seek(static_cast<long>(at), SEEK_FROM_START));
        ASSERT_EQ(kPiece, f.read(piece.data(), kPiece)) << "at " << at;
        for (uint32_t k = 0; k < kPiece; k += 4096) ASSERT_EQ(patternAt(at + k), piece[k]) << "at " << at + k;
        // Past the first few MiB of the pass (what the reads at random
        // left resident is dropped by then), the pass holds what it reads.
        if (bytes - at >= (4u << 20) && at % (1u << 20) == 0) most = std::max(most, residentFileKib() - before);
    }
    EXPECT_LT(most, kResidentLimitKib);
    EXPECT_TRUE(f.close());
}
