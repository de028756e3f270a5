// Special files (named pipes, character devices, links) in trees that are
// scanned with checksums.  Only regular files are ever read: a pipe with no
// writer or a device that never ends must not stop a scan, and a path that
// changes kind between the walk's lstat and the checksum's open is neither
// followed nor read.
//
// Every piece of work that would block on such a file runs in a child process
// under alarm(), so that a walk that blocks fails its test instead of hanging
// the suite.  The child hands its findings to the parent as lines of text.
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <functional>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/fsbuild.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"
#include "support/toolrun.h"

using testsupport::TempDir;
using testsupport::bytesOf;
using testsupport::widen;

namespace {

// Seconds a child may take for work that finishes in milliseconds when
// nothing blocks; generous for sanitizer builds and the 32-bit emulator.
const unsigned int kChildSeconds = 20;
const unsigned int kToolSeconds = 30;

// Sums of the two-byte file "a\n" (shorter than 1024 bytes, so Q32 = CRC32).
const std::string kMd5OfA = "60b725f10c9c85c70d97880dfe8191b3";
const uint32_t kCrcOfA = 0xddeaa107u;
// The text form of an MD5 that was never computed.
const std::string kZeroMd5(32, '0');

const uint32_t kAllThree = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5;

// ------------------------------------------------------------- the guard

struct Guarded {
    bool finished = false;  // the child ran to its end
    std::string why;        // how it ended otherwise
    std::string report;     // what it wrote
    std::vector<std::string> lines() const {
        std::vector<std::string> out;
        std::istringstream in(report);
        std::string line;
        while (std::getline(in, line)) out.push_back(line);
        return out;
    }
};

// Runs work in a child process that alarm() ends after seconds, and returns
// what work returned.  The parent reads until the child is gone, so a child
// killed by its alarm leaves finished false and why naming the signal.
Guarded runGuarded(const std::function<std::string()>& work, unsigned int seconds = kChildSeconds) {
    Guarded outcome;
    int fds[2];
    if (pipe(fds) != 0) {
        outcome.why = "pipe failed";
        return outcome;
    }
    pid_t child = fork();
    if (child < 0) {
        close(fds[0]);
        close(fds[1]);
        outcome.why = "fork failed";
        return outcome;
    }
    if (child == 0) {
        close(fds[0]);
        signal(SIGALRM, SIG_DFL);
        alarm(seconds);
        std::string report = work();
        const char* p = report.data();
        size_t left = report.size();
        while (left > 0) {
            ssize_t n = write(fds[1], p, left);
            if (n <= 0) _exit(3);
            p += n;
            left -= static_cast<size_t>(n);
        }
        _exit(0);
    }
    close(fds[1]);
    char buffer[4096];
    for (;;) {
        ssize_t n = read(fds[0], buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) break;
        outcome.report.append(buffer, static_cast<size_t>(n));
    }
    close(fds[0]);
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    if (WIFEXITED(status) && WEXITSTATUS(status) == 0) {
        outcome.finished = true;
    } else if (WIFSIGNALED(status)) {
        outcome.why = WTERMSIG(status) == SIGALRM
                          ? "did not finish within " + std::to_string(seconds) + " s (blocked)"
                          : "killed by signal " + std::to_string(WTERMSIG(status));
    } else {
        outcome.why = "exit code " + std::to_string(WEXITSTATUS(status));
    }
    return outcome;
}

// -------------------------------------------------------- fixture helpers

std::string stripSlash(std::string path) {
    while (path.size() > 1 && path.back() == '/') path.pop_back();
    return path;
}

void makeFifo(const std::string& path) { ASSERT_EQ(0, mkfifo(path.c_str(), 0644)) << path; }

// A character device with the numbers of /dev/zero, which reads for ever.
// Empty when this process may not make device nodes.
std::string makeZeroDevice(const std::string& path) {
    if (geteuid() != 0) return "needs root to create a device node";
    if (mknod(path.c_str(), S_IFCHR | 0644, makedev(1, 5)) != 0)
        return std::string("mknod failed: ") + std::strerror(errno);
    return "";
}

std::string md5Text(const u_int128& digest) {
    char text[MD5_TEXT_SIZE];
    md52char(digest, text);
    return text;
}

std::string hex8(uint32_t value) {
    char text[16];
    std::snprintf(text, sizeof text, "%08x", static_cast<unsigned int>(value));
    return text;
}

std::vector<std::string> split(const std::string& line, char separator) {
    std::vector<std::string> fields;
    std::string field;
    std::istringstream in(line);
    while (std::getline(in, field, separator)) fields.push_back(field);
    return fields;
}

// ------------------------------------------------------- the checksum call

// One call of computeFileChecksumInfo (or, with walkForm, of the walks'
// computeRegularFileChecksumInfo) with all three sums asked for and every
// sum pre-set to a marker, reported as "rc valid crc q32 md5".
std::string checksumReport(const std::string& path, bool walkForm = false) {
    FileChecksumInfo info;
    info.flags = kAllThree;
    info.crc32 = 0x11111111u;
    info.q32 = 0x22222222u;
    std::memset(info.md5.bytes, 0x33, sizeof info.md5.bytes);
    int rc = walkForm ? computeRegularFileChecksumInfo(info, path.c_str())
                      : computeFileChecksumInfo(info, path.c_str());
    return std::to_string(rc) + " " + (info.valid ? "1" : "0") + " " + hex8(info.crc32) + " " +
           hex8(info.q32) + " " + md5Text(info.md5) + "\n";
}

// What a refused path leaves: -1, valid false, the markers untouched.
const std::string kRefusedUntouched = "-1 0 11111111 22222222 " + std::string(32, '3') + "\n";

// ---------------------------------------------------------- the direct walk

struct Offer {
    std::string path;
    unsigned int attr = 0;
    bool valid = false;
    uint32_t flags = 0;
    uint32_t crc32 = 0;
    uint32_t q32 = 0;
    std::string md5;
};
std::vector<Offer> offers;

void observe(const FsFileInfo& info, const FileChecksumInfo& sums, const wchar_t*) {
    Offer o;
    o.path = testsupport::joinPath(bytesOf(info.getPath()), bytesOf(info.getName()));
    o.attr = info.getAttr();
    o.valid = sums.valid;
    o.flags = sums.flags;
    o.crc32 = sums.crc32;
    o.q32 = sums.q32;
    o.md5 = md5Text(sums.md5);
    offers.push_back(o);
}

// Walks root directly with these checksum flags, hashes and criteria, and
// reports "result N", then "offer path attr valid flags crc q32 md5" for each
// file offered to the criteria stage in walk order, then "hit path".
std::string walkReport(const std::string& root, unsigned int flags, FileHashBlackBox* hashes,
                       const wchar_t* criteria) {
    offers.clear();
    FileProcessor::setCriteriaObserver(observe);
    testsupport::HitWriter writer;
    FileProcessor processor(criteria, true, flags, hashes);
    std::vector<PathInfo> includes, excludes;
    PathDrive drive(widen(root).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    int result = fs_build(writer, processor, drive, includes, excludes, true, 2000000000);
    FileProcessor::setCriteriaObserver(nullptr);
    std::string report = "result " + std::to_string(result) + "\n";
    for (const Offer& o : offers) {
        report += "offer\t" + o.path + "\t" + std::to_string(o.attr) + "\t" + (o.valid ? "1" : "0") +
                  "\t" + std::to_string(o.flags) + "\t" + hex8(o.crc32) + "\t" + hex8(o.q32) + "\t" +
                  o.md5 + "\n";
    }
    for (const std::string& hit : writer.hits) report += "hit\t" + hit + "\n";
    return report;
}

struct WalkResult {
    int result = -100;
    std::vector<Offer> offers;  // walk order
    std::set<std::string> hits;
    const Offer* offer(const std::string& path) const {
        for (const Offer& o : offers)
            if (o.path == path) return &o;
        return nullptr;
    }
};

WalkResult parseWalk(const Guarded& g) {
    WalkResult w;
    for (const std::string& line : g.lines()) {
        if (line.compare(0, 7, "result ") == 0) {
            w.result = std::atoi(line.c_str() + 7);
            continue;
        }
        std::vector<std::string> f = split(line, '\t');
        if (f.size() == 8 && f[0] == "offer") {
            Offer o;
            o.path = f[1];
            o.attr = static_cast<unsigned int>(std::strtoul(f[2].c_str(), nullptr, 10));
            o.valid = f[3] == "1";
            o.flags = static_cast<uint32_t>(std::strtoul(f[4].c_str(), nullptr, 10));
            o.crc32 = static_cast<uint32_t>(std::strtoul(f[5].c_str(), nullptr, 16));
            o.q32 = static_cast<uint32_t>(std::strtoul(f[6].c_str(), nullptr, 16));
            o.md5 = f[7];
            w.offers.push_back(o);
        } else if (f.size() == 2 && f[0] == "hit") {
            w.hits.insert(f[1]);
        }
    }
    return w;
}

std::string directoryOf(const std::string& path) { return path.substr(0, path.rfind('/')); }

// A file whose content is not read is offered with the sums the walk's
// checksum record already holds: those of the file offered before it in the
// same directory, or none at all when it comes first there (a link has
// always been treated so).
void expectOfferedWithoutReading(const WalkResult& w, const std::string& path) {
    const Offer* previous = nullptr;
    const Offer* self = nullptr;
    for (const Offer& o : w.offers) {
        if (o.path == path) {
            self = &o;
            break;
        }
        if (directoryOf(o.path) == directoryOf(path)) previous = &o;
    }
    ASSERT_NE(nullptr, self) << path << " was not offered";
    EXPECT_EQ(kAllThree, self->flags) << path;
    if (previous == nullptr) {
        EXPECT_FALSE(self->valid) << path;
        EXPECT_EQ(0u, self->crc32) << path;
        EXPECT_EQ(0u, self->q32) << path;
        EXPECT_EQ(kZeroMd5, self->md5) << path;
    } else {
        EXPECT_EQ(previous->valid, self->valid) << path;
        EXPECT_EQ(previous->crc32, self->crc32) << path;
        EXPECT_EQ(previous->q32, self->q32) << path;
        EXPECT_EQ(previous->md5, self->md5) << path;
    }
}

void expectSumsOfA(const WalkResult& w, const std::string& path) {
    const Offer* o = w.offer(path);
    ASSERT_NE(nullptr, o) << path << " was not offered";
    EXPECT_TRUE(o->valid);
    EXPECT_EQ(kAllThree, o->flags);
    EXPECT_EQ(kMd5OfA, o->md5);
    EXPECT_EQ(kCrcOfA, o->crc32);
    EXPECT_EQ(kCrcOfA, o->q32);
}

const unsigned int kAllThreeProcessing =
    FileProcessor::PROCESS_MD5 | FileProcessor::PROCESS_CRC32 | FileProcessor::PROCESS_Q32;

// ------------------------------------------------------------ the cache

// Collects every hit with the checksum fields it carries.
class SumWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long, unsigned int,
                  const wchar_t* md5, unsigned int crc32, unsigned int q32) override {
        rows[testsupport::joinPath(bytesOf(path), bytesOf(name))] =
            bytesOf(md5) + "\t" + hex8(crc32) + "\t" + hex8(q32);
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        return addRecord(info.getPath(), info.getName(), 0, 0, info.getMD5(), info.getCRC32(),
                         info.getQ32());
    }
    int close() override { return 0; }
    std::map<std::string, std::string> rows;
};

// One query "[SIZE]>=0" over root through a fresh FS_Cache in cacheDir,
// reported as "result N" and "hit path md5 crc q32" lines.
std::string cacheReport(const std::string& cacheDir, const std::string& root, FsGlue glue) {
    FS_Cache cache(L"dirs", L"files", widen(cacheDir).c_str(), false, true, &glue, L"prov");
    if (cache.create(0, FS_CACHE_OPEN_ALWAYS) != 0) return "create failed\n";
    FsQuery query;
    query.setQuery(L"[SIZE]>=0");
    query.addIncludePath(widen(root).c_str(), true);
    SumWriter writer;
    int result = cache.executeQueryEx(writer, query, 600000, 3600);
    cache.close();
    std::string report = "result " + std::to_string(result) + "\n";
    for (const auto& row : writer.rows) report += "hit\t" + row.first + "\t" + row.second + "\n";
    return report;
}

struct CacheResult {
    int result = -100;
    std::map<std::string, std::string> rows;  // path -> "md5 crc q32"
};

CacheResult parseCache(const Guarded& g) {
    CacheResult c;
    for (const std::string& line : g.lines()) {
        if (line.compare(0, 7, "result ") == 0) {
            c.result = std::atoi(line.c_str() + 7);
            continue;
        }
        std::vector<std::string> f = split(line, '\t');
        if (f.size() == 5 && f[0] == "hit") c.rows[f[1]] = f[2] + "\t" + f[3] + "\t" + f[4];
    }
    return c;
}

const std::string kRowOfA = kMd5OfA + "\t" + hex8(kCrcOfA) + "\t" + hex8(kCrcOfA);
const std::string kRowWithoutSums = kZeroMd5 + "\t00000000\t00000000";

FsGlue checksumGlue() {
    FsGlue glue = testsupport::plainGlue();
    glue.checksumFlags = 0xe0;
    return glue;
}

}  // namespace

// ================================================== the checksum routine

TEST(SpecialFileChecksum, RegularFileSumsStayAsTheyWere) {
    TempDir dir;
    std::string file = dir.write("regular", "a\n");
    Guarded g = runGuarded([&] { return checksumReport(file); });
    ASSERT_TRUE(g.finished) << g.why;
    EXPECT_EQ("0 1 " + hex8(kCrcOfA) + " " + hex8(kCrcOfA) + " " + kMd5OfA + "\n", g.report);
}

TEST(SpecialFileChecksum, FifoIsRefusedAtOnceWithoutReading) {
    TempDir dir;
    makeFifo(dir.file("pipe"));
    Guarded g = runGuarded([&] { return checksumReport(dir.file("pipe")); });
    ASSERT_TRUE(g.finished) << g.why;
    EXPECT_EQ(kRefusedUntouched, g.report);
}

TEST(SpecialFileChecksum, CharacterDeviceIsRefusedAtOnceWithoutReading) {
    Guarded g = runGuarded([] { return checksumReport("/dev/zero"); });
    ASSERT_TRUE(g.finished) << g.why;
    EXPECT_EQ(kRefusedUntouched, g.report);
}

// The walks look at a file with lstat and open it later: in between, the
// regular file may be replaced.  The open must notice, not read or follow.
TEST(SpecialFileChecksum, RegularFileReplacedByFifoAfterLstatIsNotRead) {
    TempDir dir;
    std::string path = dir.write("swapped", "a\n");
    struct stat before;
    ASSERT_EQ(0, lstat(path.c_str(), &before));
    ASSERT_TRUE(S_ISREG(before.st_mode));
    ASSERT_EQ(0, unlink(path.c_str()));
    makeFifo(path);
    Guarded g = runGuarded([&] { return checksumReport(path) + checksumReport(path, true); });
    ASSERT_TRUE(g.finished) << g.why;
    EXPECT_EQ(kRefusedUntouched + kRefusedUntouched, g.report);
}

TEST(SpecialFileChecksum, RegularFileReplacedBySymlinkAfterLstatIsNotFollowed) {
    TempDir dir;
    std::string target = dir.write("target", "a\n");
    makeFifo(dir.file("pipe"));
    std::string toFile = dir.write("toFile", "a\n");
    std::string toPipe = dir.write("toPipe", "a\n");
    struct stat before;
    ASSERT_EQ(0, lstat(toFile.c_str(), &before));
    ASSERT_TRUE(S_ISREG(before.st_mode));
    ASSERT_EQ(0, unlink(toFile.c_str()));
    ASSERT_EQ(0, unlink(toPipe.c_str()));
    ASSERT_EQ(0, symlink(target.c_str(), toFile.c_str()));
    ASSERT_EQ(0, symlink(dir.file("pipe").c_str(), toPipe.c_str()));
    Guarded g = runGuarded([&] {
        return checksumReport(toFile, true) + checksumReport(toPipe, true) + checksumReport(toFile) +
               checksumReport(toPipe);
    });
    ASSERT_TRUE(g.finished) << g.why;
    // The walks' form refuses a link to a regular file just as one to a
    // pipe: its open never follows the last component.  The host's form
    // follows links as it always has, and still never reads a pipe.
    EXPECT_EQ(kRefusedUntouched + kRefusedUntouched + "0 1 " + hex8(kCrcOfA) + " " + hex8(kCrcOfA) +
                  " " + kMd5OfA + "\n" + kRefusedUntouched,
              g.report);
}

TEST(SpecialFileChecksum, WalkFormRefusesADirectoryWhileTheHostFormStillFailsItsRead) {
    TempDir dir;
    std::string sub = dir.mkdirs("sub");
    Guarded g = runGuarded([&] { return checksumReport(sub, true); });
    ASSERT_TRUE(g.finished) << g.why;
    EXPECT_EQ(kRefusedUntouched, g.report);
    // The host's form opens the directory and fails its first read: -2 and
    // the sums of empty input.
    Guarded h = runGuarded([&] { return checksumReport(sub); });
    ASSERT_TRUE(h.finished) << h.why;
    EXPECT_EQ("-2 0 00000000 00000000 d41d8cd98f00b204e9800998ecf8427e\n", h.report);
}

// ======================================================= the direct walk

TEST(SpecialFileDirectWalk, FifoWithChecksumsIsOfferedWithoutBeingRead) {
    TempDir dir;
    std::string root = stripSlash(dir.path());
    dir.write("regular", "a\n");
    makeFifo(dir.file("pipe"));
    ASSERT_EQ(0, symlink("regular", dir.file("link").c_str()));
    dir.mkdirs("alone");
    makeFifo(dir.file("alone/pipe"));
    Guarded g = runGuarded([&] { return walkReport(root, kAllThreeProcessing, nullptr, L"[SIZE]>=0"); });
    ASSERT_TRUE(g.finished) << g.why;
    WalkResult w = parseWalk(g);
    EXPECT_EQ(0, w.result);
    std::set<std::string> all{root + "/regular", root + "/pipe", root + "/link", root + "/alone/pipe"};
    EXPECT_EQ(all, w.hits);
    ASSERT_EQ(4u, w.offers.size()) << g.report;
    expectSumsOfA(w, root + "/regular");
    // A pipe is treated as a link is: its content is never read.
    expectOfferedWithoutReading(w, root + "/pipe");
    expectOfferedWithoutReading(w, root + "/link");
    expectOfferedWithoutReading(w, root + "/alone/pipe");
    const Offer* alone = w.offer(root + "/alone/pipe");
    ASSERT_NE(nullptr, alone);
    EXPECT_FALSE(alone->valid);
    EXPECT_EQ(kZeroMd5, alone->md5);
    EXPECT_EQ(0u, alone->attr & (FsFileInfo::ATTR_REGULAR | FsFileInfo::ATTR_DIRECTORY));
}

TEST(SpecialFileDirectWalk, FifoThatIsNoHitDoesNotStopANameQueryWithKnownSums) {
    TempDir dir;
    std::string root = stripSlash(dir.path());
    dir.write("regular", "a\n");
    makeFifo(dir.file("pipe"));
    Guarded g = runGuarded([&] {
        FileHashBlackBox known;
        known.insert_md5(char2md5(kMd5OfA.c_str()));
        return walkReport(root, FileProcessor::PROCESS_MD5, &known, L"[FILENAME]==\"regular\"");
    });
    ASSERT_TRUE(g.finished) << g.why;
    WalkResult w = parseWalk(g);
    EXPECT_EQ(0, w.result);
    EXPECT_EQ(std::set<std::string>{root + "/regular"}, w.hits);
    const Offer* regular = w.offer(root + "/regular");
    ASSERT_NE(nullptr, regular);
    EXPECT_EQ(kMd5OfA, regular->md5);
}

TEST(SpecialFileDirectWalk, CharacterDeviceWithChecksumsIsOfferedWithoutBeingRead) {
    TempDir dir;
    std::string root = stripSlash(dir.path());
    dir.write("regular", "a\n");
    std::string refused = makeZeroDevice(dir.file("zero"));
    if (!refused.empty()) GTEST_SKIP() << "no device node in the fixture: " << refused;
    Guarded g = runGuarded([&] { return walkReport(root, kAllThreeProcessing, nullptr, L"[SIZE]>=0"); });
    ASSERT_TRUE(g.finished) << g.why;
    WalkResult w = parseWalk(g);
    EXPECT_EQ(0, w.result);
    EXPECT_EQ((std::set<std::string>{root + "/regular", root + "/zero"}), w.hits);
    expectSumsOfA(w, root + "/regular");
    expectOfferedWithoutReading(w, root + "/zero");
    const Offer* zero = w.offer(root + "/zero");
    ASSERT_NE(nullptr, zero);
    EXPECT_NE(0u, zero->attr & FsFileInfo::ATTR_CHAR_DEVICE);
}

// ============================================================= the cache

TEST(SpecialFileCache, ScanWithChecksumsStoresAFifoWithoutSums) {
    testsupport::MachineFixture machine;
    TempDir cacheDir;
    TempDir tree;
    std::string root = stripSlash(tree.path());
    tree.write("regular", "a\n");
    makeFifo(tree.file("pipe"));
    ASSERT_EQ(0, symlink("regular", tree.file("link").c_str()));
    Guarded g = runGuarded([&] { return cacheReport(cacheDir.path(), root, checksumGlue()); });
    ASSERT_TRUE(g.finished) << g.why;
    CacheResult c = parseCache(g);
    EXPECT_EQ(0, c.result);
    std::map<std::string, std::string> expected{{root + "/regular", kRowOfA},
                                                {root + "/pipe", kRowWithoutSums},
                                                {root + "/link", kRowWithoutSums}};
    EXPECT_EQ(expected, c.rows) << g.report;
}

TEST(SpecialFileCache, ExtractionWithKnownSumsPassesOverAFifo) {
    testsupport::MachineFixture machine;
    TempDir cacheDir;
    TempDir tree;
    std::string root = stripSlash(tree.path());
    tree.write("regular", "a\n");
    tree.write("other", "b\n");
    makeFifo(tree.file("pipe"));
    Guarded g = runGuarded([&] {
        // The cache keeps no sums: the extraction computes them for the filter.
        FileHashBlackBox known;
        known.insert_md5(char2md5(kMd5OfA.c_str()));
        FsGlue glue = testsupport::plainGlue();
        glue.knownHashes = &known;
        return cacheReport(cacheDir.path(), root, glue);
    });
    ASSERT_TRUE(g.finished) << g.why;
    CacheResult c = parseCache(g);
    EXPECT_EQ(0, c.result);
    std::map<std::string, std::string> expected{{root + "/regular", "0\t00000000\t00000000"}};
    EXPECT_EQ(expected, c.rows) << g.report;
}

TEST(SpecialFileCache, CharacterDeviceIsStoredWithoutSumsAndPassedOverByTheFilter) {
    testsupport::MachineFixture machine;
    TempDir cacheDir;
    TempDir otherCacheDir;
    TempDir tree;
    std::string root = stripSlash(tree.path());
    tree.write("regular", "a\n");
    std::string refused = makeZeroDevice(tree.file("zero"));
    if (!refused.empty()) GTEST_SKIP() << "no device node in the fixture: " << refused;
    Guarded withSums = runGuarded([&] { return cacheReport(cacheDir.path(), root, checksumGlue()); });
    ASSERT_TRUE(withSums.finished) << withSums.why;
    CacheResult c = parseCache(withSums);
    EXPECT_EQ(0, c.result);
    std::map<std::string, std::string> expected{{root + "/regular", kRowOfA},
                                                {root + "/zero", kRowWithoutSums}};
    EXPECT_EQ(expected, c.rows) << withSums.report;

    Guarded filtered = runGuarded([&] {
        FileHashBlackBox known;
        known.insert_md5(char2md5(kMd5OfA.c_str()));
        FsGlue glue = testsupport::plainGlue();
        glue.knownHashes = &known;
        return cacheReport(otherCacheDir.path(), root, glue);
    });
    ASSERT_TRUE(filtered.finished) << filtered.why;
    CacheResult f = parseCache(filtered);
    EXPECT_EQ(0, f.result);
    EXPECT_EQ((std::map<std::string, std::string>{{root + "/regular", "0\t00000000\t00000000"}}),
              f.rows);
}

// ============================================================== the tool

namespace {

using testsupport::ToolRun;

// Runs the built tool on the fixture's own mount table and cache; an alarm
// set before the exec ends a run that blocks (status 128 + SIGALRM).
ToolRun runOnFixture(const TempDir& dir, const std::vector<std::string>& args) {
    std::vector<std::string> all{"--mount-table", dir.file("mtab"), "--cache", dir.file("cache")};
    all.insert(all.end(), args.begin(), args.end());
    testsupport::ToolOptions options;
    options.alarmSeconds = kToolSeconds;
    return testsupport::runTool(dir, all, options);
}

}  // namespace

TEST(SpecialFileTool, Md5QueriesOverATreeWithAFifoCompleteInBothModes) {
    TempDir dir;
    dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
    std::string tree = dir.mkdirs("tree");
    dir.write("tree/regular", "a\n");
    makeFifo(dir.file("tree/pipe"));

    // Text output with sums lists only the files that have sums: the pipe,
    // which is never read, gets no line in either mode.
    ToolRun direct = runOnFixture(dir, {"--no-cache", "--md5", tree});
    ASSERT_EQ(0, direct.status) << direct.err;
    EXPECT_EQ((std::set<std::string>{kMd5OfA + "  " + tree + "/regular"}), direct.lineSet());

    ToolRun cached = runOnFixture(dir, {"--md5", tree});
    ASSERT_EQ(0, cached.status) << cached.err;
    EXPECT_EQ((std::set<std::string>{kMd5OfA + "  " + tree + "/regular"}), cached.lineSet());

    ToolRun named = runOnFixture(dir, {"--no-cache", "--md5", "--timeout", "2000", "--name", "regular", tree});
    ASSERT_EQ(0, named.status) << named.err;
    EXPECT_EQ(std::set<std::string>{kMd5OfA + "  " + tree + "/regular"}, named.lineSet());

    ToolRun crc = runOnFixture(dir, {"--crc32", tree});
    ASSERT_EQ(0, crc.status) << crc.err;
    EXPECT_EQ((std::set<std::string>{hex8(kCrcOfA) + "  " + tree + "/regular"}), crc.lineSet());

    ToolRun known = runOnFixture(dir, {"--known-md5", kMd5OfA, tree});
    ASSERT_EQ(0, known.status) << known.err;
    EXPECT_EQ(std::set<std::string>{tree + "/regular"}, known.lineSet());
}
