// The direct walk: what it visits, what it offers, in which order, and where
// it stops.  Fixtures are built in temporary directories.
#include <gtest/gtest.h>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/utils.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

const int kBudget = 2000000000;
// An expression that holds for every file: the walk tests look at what is
// visited and offered, not at what the criteria stage picks.
const wchar_t* const kEveryFile = L"[SIZE]>=0";

std::wstring wide(const std::string& text) {
    wchar_t* w = utils::myMbsToWcsString(text.c_str());
    std::wstring out(w);
    delete[] w;
    return out;
}

std::string narrow(const wchar_t* text) {
    char* n = utils::myWcsToMbsString(text);
    std::string out(n);
    delete[] n;
    return out;
}

// Collects what the walk writes, as full narrow paths in arrival order.
class RecordingWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t*, const wchar_t*, unsigned long long, unsigned int, const wchar_t*,
                  unsigned int, unsigned int) override {
        return -1;
    }
    int addRecord(const FsFileInfo& info) override {
        records.push_back(info);
        paths.push_back(narrow(info.getPath()) + narrow(info.getName()));
        return 0;
    }
    int close() override { return 0; }

    std::vector<FsFileInfo> records;
    std::vector<std::string> paths;
};

// What the criteria stage was offered, through the processor's test seam.
struct Offer {
    std::string path;
    unsigned int attr;
    bool valid;
    uint32_t flags;
    uint32_t crc32;
    uint32_t q32;
    bool shortNameNull;
};
std::vector<Offer> offers;

void observe(const FsFileInfo& info, const FileChecksumInfo& sums, const wchar_t* shortName) {
    Offer o;
    o.path = narrow(info.getPath()) + narrow(info.getName());
    o.attr = info.getAttr();
    o.valid = sums.valid;
    o.flags = sums.flags;
    o.crc32 = sums.crc32;
    o.q32 = sums.q32;
    o.shortNameNull = shortName == nullptr;
    offers.push_back(o);
}

class ObserverScope {
public:
    ObserverScope() {
        offers.clear();
        FileProcessor::setCriteriaObserver(observe);
    }
    ~ObserverScope() { FileProcessor::setCriteriaObserver(nullptr); }
};

bool convertible(const std::string& name) {
    size_t n = mbstowcs(nullptr, name.c_str(), 0);
    return n != static_cast<size_t>(-1) && n > 0;
}

// Independent order oracle: reverse readdir order, a subdirectory's files at
// the subdirectory's place, links never followed.
void expectedOrder(const std::string& dir, std::vector<std::string>& out) {
    std::vector<std::string> names;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) return;
    while (struct dirent* e = readdir(d)) names.push_back(e->d_name);
    closedir(d);
    std::string prefix = dir.back() == '/' ? dir : dir + "/";
    for (auto it = names.rbegin(); it != names.rend(); ++it) {
        if (*it == "." || *it == ".." || !convertible(*it)) continue;
        std::string full = prefix + *it;
        struct stat st;
        if (lstat(full.c_str(), &st) != 0) continue;
        if (S_ISDIR(st.st_mode)) {
            expectedOrder(full, out);
        } else {
            out.push_back(full);
        }
    }
}

// The fixture tree of the walk tests.
struct Tree {
    TempDir dir;
    std::string root;
    Tree() {
        root = dir.path();
        dir.write("a.txt", "abc");
        dir.write("sub/b.txt", "bee");
        dir.write("sub/deeper/c.txt", "sea");
        dir.write("sub/deeper/d.bin", "");
        dir.mkdirs("empty");
        dir.write("locked/hidden.txt", "hidden");
        symlink("sub", dir.file("linkdir").c_str());
        symlink("a.txt", dir.file("linkfile").c_str());
        int fd = open(dir.file("bad\xff").c_str(), O_CREAT | O_WRONLY, 0644);
        if (fd >= 0) close(fd);
        chmod(dir.file("locked").c_str(), 0);
    }
    ~Tree() { chmod(dir.file("locked").c_str(), 0755); }
};

bool runningAsRoot() { return geteuid() == 0; }

int walk(RecordingWriter& writer, FileProcessor& processor, const std::string& path, bool recursive,
         std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes, int timeoutMs = kBudget,
         const DriveInfo& drive = DriveInfo(L"/:", dtLocal, L"ext4")) {
    PathDrive root(wide(path).c_str(), recursive, drive);
    return fs_build(writer, processor, root, includes, excludes, true, timeoutMs);
}

std::string joined(const std::vector<std::string>& v) {
    std::ostringstream s;
    for (const std::string& x : v) s << x << "\n";
    return s.str();
}

}  // namespace

// ----------------------------------------------------------------- scandir

TEST(Scandir, EmptyDirectoryYieldsDotAndDotDot) {
    TempDir dir;
    dirent** list = nullptr;
    int n = scandir(dir.path().c_str(), &list);
    ASSERT_EQ(n, 2);
    std::set<std::string> names;
    for (int i = 0; i < n; ++i) {
        names.insert(list[i]->d_name);
        kelm_free(list[i]);
    }
    kelm_free(list);
    EXPECT_EQ(names, (std::set<std::string>{".", ".."}));
}

TEST(Scandir, KeepsReaddirOrderUnfiltered) {
    TempDir dir;
    for (int i = 0; i < 20; ++i) dir.write("f" + std::to_string(i), "");
    std::vector<std::string> expected;
    DIR* d = opendir(dir.path().c_str());
    while (struct dirent* e = readdir(d)) expected.push_back(e->d_name);
    closedir(d);
    dirent** list = nullptr;
    int n = scandir(dir.path().c_str(), &list);
    ASSERT_EQ(n, 22);
    std::vector<std::string> got;
    for (int i = 0; i < n; ++i) {
        got.push_back(list[i]->d_name);
        kelm_free(list[i]);
    }
    kelm_free(list);
    EXPECT_EQ(got, expected);
}

TEST(Scandir, MissingDirectoryFailsWithTrace) {
    TraceCapture capture;
    dirent** list = nullptr;
    EXPECT_EQ(scandir("/nonexistent/h1/dir", &list), -1);
    EXPECT_TRUE(capture.contains("::scandir CAN'T OPEN /nonexistent/h1/dir dir, errno: 2 ("))
        << capture.dump();
}

namespace {

// Descriptors this process has open, from /proc/self/fd.
int openDescriptors() {
    int n = 0;
    DIR* d = opendir("/proc/self/fd");
    if (d == nullptr) return -1;
    while (readdir(d) != nullptr) ++n;
    closedir(d);
    return n;
}

}  // namespace

// Out of memory while the list grows: the first growth fails, so there is
// no list at all; the handle is closed all the same.
TEST(Scandir, ListThatCannotGrowFailsWithTraceAndClosesTheDirectory) {
    TempDir dir;
    dir.write("a", "");
    int before = openDescriptors();
    TraceCapture capture;
    dirent** list = nullptr;
    kelm_failAfter(0);
    int n = scandir(dir.path().c_str(), &list);
    kelm_failAfter(-1);
    EXPECT_EQ(-1, n);
    EXPECT_EQ(nullptr, list);
    EXPECT_TRUE(capture.contains("::scandir - *namelist == NULL!\n")) << capture.dump();
    EXPECT_FALSE(capture.contains("(*namelist)[i] == NULL!"));
    EXPECT_EQ(before, openDescriptors());
}

// Out of memory for the copy of the second entry: the list keeps the first
// entry (the caller owns it), the slot grown for the second holds nothing
// that was handed out, and the handle is closed.
TEST(Scandir, EntryThatCannotBeCopiedFailsWithTraceAndKeepsTheEntriesSoFar) {
    TempDir dir;
    dir.write("a", "");
    dir.write("b", "");
    std::vector<std::string> order;
    DIR* d = opendir(dir.path().c_str());
    while (struct dirent* e = readdir(d)) order.push_back(e->d_name);
    closedir(d);
    ASSERT_EQ(4u, order.size());
    int before = openDescriptors();
    TraceCapture capture;
    dirent** list = nullptr;
    kelm_failAfter(3);  // grow, copy, grow; the second copy fails
    int n = scandir(dir.path().c_str(), &list);
    kelm_failAfter(-1);
    EXPECT_EQ(-1, n);
    ASSERT_NE(nullptr, list);
    EXPECT_STREQ(order[0].c_str(), list[0]->d_name);
    EXPECT_TRUE(capture.contains("::scandir - (*namelist)[i] == NULL!\n")) << capture.dump();
    EXPECT_FALSE(capture.contains("*namelist == NULL!\n"));
    EXPECT_EQ(before, openDescriptors());
    kelm_free(list[0]);
    kelm_free(list);
}

// ---------------------------------------------------------- fs_isValidPath

TEST(FsIsValidPath, OnlyRealDirectoriesPass) {
    TempDir dir;
    dir.write("file", "x");
    dir.mkdirs("d");
    symlink("d", dir.file("link").c_str());
    std::wstring d = wide(dir.file("d"));
    std::wstring f = wide(dir.file("file"));
    std::wstring l = wide(dir.file("link"));
    EXPECT_TRUE(fs_isValidPath(&d[0]));
    EXPECT_FALSE(fs_isValidPath(&f[0]));
    EXPECT_FALSE(fs_isValidPath(&l[0]));
}

TEST(FsIsValidPath, NullAndMissingPathsTrace) {
    TraceCapture capture;
    EXPECT_FALSE(fs_isValidPath(nullptr));
    EXPECT_TRUE(capture.contains("fs_isValidPath - path name specified is null"));
    std::wstring missing = L"/nonexistent/h1";
    EXPECT_FALSE(fs_isValidPath(&missing[0]));
    EXPECT_TRUE(capture.contains("fs_isValidPath - lstat error opening '/nonexistent/h1' path, errno: 2"));
}

// ------------------------------------------------------------------ fs_build

TEST(FsBuild, TreeMatchesFindAndReverseReaddirOrder) {
    Tree tree;
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, tree.root, true, includes, excludes), 0);

    std::vector<std::string> expected;
    expectedOrder(tree.root, expected);
    EXPECT_EQ(joined(writer.paths), joined(expected));

    int status = 0;
    std::string found = testsupport::runCommand("find '" + tree.root + "' -mindepth 1 ! -type d 2>/dev/null", &status);
    std::set<std::string> fromFind;
    std::istringstream lines(found);
    std::string line;
    while (std::getline(lines, line)) {
        std::string base = line.substr(line.rfind('/') + 1);
        if (convertible(base)) fromFind.insert(line);
    }
    std::set<std::string> fromWalk(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(fromWalk.size(), writer.paths.size());
    EXPECT_EQ(joined(std::vector<std::string>(fromWalk.begin(), fromWalk.end())),
              joined(std::vector<std::string>(fromFind.begin(), fromFind.end())));

    // Both links are offered as files; the link to a directory is not followed.
    EXPECT_EQ(fromWalk.count(tree.root + "/linkdir"), 1u);
    EXPECT_EQ(fromWalk.count(tree.root + "/linkfile"), 1u);
    EXPECT_EQ(fromWalk.count(tree.root + "/linkdir/b.txt"), 0u);
    EXPECT_EQ(fromWalk.count(tree.root + "/sub/b.txt"), 1u);
    EXPECT_EQ(fromWalk.count(tree.root + "/sub/deeper/c.txt"), 1u);
    // The locked directory is read only where permissions do not apply.
    EXPECT_EQ(fromWalk.count(tree.root + "/locked/hidden.txt"), runningAsRoot() ? 1u : 0u);
    if (!runningAsRoot()) {
        EXPECT_TRUE(capture.contains("::fs_scan - scandir error opening '" + tree.root + "/locked' path!"));
    }
    // The name the C locale cannot convert is skipped with its trace.
    EXPECT_EQ(capture.count("::fs_scan - file name len is 0. file skipped!"), 1u);
}

namespace {

// The walk of the fixture tree where the locked directory really can't be
// read.  0 when everything held, else the number of the first check that
// failed.
int walkOverTheLockedDirectory(const Tree& tree) {
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    if (walk(writer, processor, tree.root, true, includes, excludes) != 0) return 1;
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    std::set<std::string> want{tree.root + "/a.txt",        tree.root + "/sub/b.txt",
                               tree.root + "/sub/deeper/c.txt", tree.root + "/sub/deeper/d.bin",
                               tree.root + "/linkdir",      tree.root + "/linkfile"};
    if (got != want) return 2;
    if (capture.count("::fs_scan - scandir error opening '" + tree.root + "/locked' path!") != 1) return 3;
    if (!capture.contains("::scandir CAN'T OPEN " + tree.root + "/locked dir, errno: 13 (")) return 4;
    return 0;
}

}  // namespace

TEST(FsBuild, UnreadableDirectoryIsSkippedWithItsTraceAndTheWalkGoesOn) {
    Tree tree;
    if (!runningAsRoot()) {
        EXPECT_EQ(walkOverTheLockedDirectory(tree), 0);
        return;
    }
    // Permissions do not bind root: walk as an unprivileged user in a child.
    ASSERT_EQ(chmod(tree.root.c_str(), 0755), 0);
    pid_t child = fork();
    ASSERT_NE(child, -1);
    if (child == 0) {
        if (setgid(65534) != 0 || setuid(65534) != 0) _exit(100);
        _exit(walkOverTheLockedDirectory(tree));
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status));
    if (WEXITSTATUS(status) == 100) GTEST_SKIP() << "cannot drop privileges";
    EXPECT_EQ(WEXITSTATUS(status), 0);
}

TEST(FsBuild, SymbolicLinkToDirectoryIsOfferedWithItsOwnLstatData) {
    Tree tree;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, tree.root, true, includes, excludes);
    bool seen = false;
    for (const FsFileInfo& info : writer.records) {
        if (wcscmp(info.getName(), L"linkdir") == 0) {
            seen = true;
            EXPECT_EQ(info.getAttr() & 0x3001u, 0x1000u);
            EXPECT_EQ(info.getSize(), 3ull);  // the link text "sub"
            EXPECT_EQ(info.getValidMask(), 0x3ffu);
            EXPECT_EQ(std::wstring(info.getPath()), wide(tree.root + "/"));
        }
    }
    EXPECT_TRUE(seen);
}

TEST(FsBuild, NonRecursiveRootVisitsOnlyItsOwnFiles) {
    Tree tree;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, tree.root, false, includes, excludes);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(got, (std::set<std::string>{tree.root + "/a.txt", tree.root + "/linkdir",
                                          tree.root + "/linkfile"}));
}

TEST(FsBuild, RootThatIsALinkOrAFileIsRefused) {
    Tree tree;
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, tree.root + "/linkdir", true, includes, excludes), 0);
    EXPECT_EQ(walk(writer, processor, tree.root + "/a.txt", true, includes, excludes), 0);
    EXPECT_TRUE(writer.paths.empty());
    EXPECT_TRUE(capture.contains("::fs_build - '" + tree.root + "/linkdir' is a symbolic link or is not a directory!"));
    EXPECT_EQ(capture.count("is a symbolic link or is not a directory!"), 2u);
}

TEST(FsBuild, ExcludedRootIsRefused) {
    Tree tree;
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    excludes.push_back(PathInfo(wide(tree.root).c_str(), true));
    EXPECT_EQ(walk(writer, processor, tree.root + "/sub", true, includes, excludes), 0);
    EXPECT_TRUE(writer.paths.empty());
    EXPECT_TRUE(capture.contains("::fs_build - path '" + tree.root + "/sub' excluded!"));
}

TEST(FsBuild, NonRecursiveIncludeOffersOneLevelButWalkStillDescends) {
    Tree tree;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    includes.push_back(PathInfo(wide(tree.root + "/sub").c_str(), false));
    includes.push_back(PathInfo(wide(tree.root + "/sub/deeper").c_str(), false));
    includes.push_back(PathInfo(wide(tree.root + "/empty").c_str(), false));
    walk(writer, processor, tree.root, true, includes, excludes);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(got, (std::set<std::string>{tree.root + "/sub/b.txt", tree.root + "/sub/deeper/c.txt",
                                          tree.root + "/sub/deeper/d.bin"}));

    RecordingWriter writer2;
    std::vector<PathInfo> onlySub;
    onlySub.push_back(PathInfo(wide(tree.root + "/sub").c_str(), false));
    walk(writer2, processor, tree.root, true, onlySub, excludes);
    EXPECT_EQ(writer2.paths, (std::vector<std::string>{tree.root + "/sub/b.txt"}));
}

TEST(FsBuild, NonRecursiveExcludeSuppressesFilesButNotSubdirectories) {
    Tree tree;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    excludes.push_back(PathInfo(wide(tree.root + "/sub").c_str(), false));
    walk(writer, processor, tree.root, true, includes, excludes);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(got.count(tree.root + "/sub/b.txt"), 0u);
    EXPECT_EQ(got.count(tree.root + "/sub/deeper/c.txt"), 1u);
    EXPECT_EQ(got.count(tree.root + "/a.txt"), 1u);
}

TEST(FsBuild, RecursiveExcludeSuppressesSubtreeBeforeEntering) {
    Tree tree;
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    excludes.push_back(PathInfo(wide(tree.root + "/sub").c_str(), true));
    excludes.push_back(PathInfo(wide(tree.root + "/linkfile").c_str(), true));
    walk(writer, processor, tree.root, true, includes, excludes);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    for (const std::string& p : got) EXPECT_EQ(p.find(tree.root + "/sub/"), std::string::npos) << p;
    EXPECT_EQ(got.count(tree.root + "/linkfile"), 0u);
    EXPECT_EQ(got.count(tree.root + "/a.txt"), 1u);
    for (const Offer& o : offers) EXPECT_EQ(o.path.find(tree.root + "/sub/"), std::string::npos);
}

TEST(FsBuild, QueryWithoutExpressionWalksWholeTreeAndWritesNothing) {
    Tree tree;
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(nullptr, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, tree.root, true, includes, excludes), 0);
    EXPECT_TRUE(writer.paths.empty());
    std::vector<std::string> expected;
    expectedOrder(tree.root, expected);
    std::vector<std::string> offered;
    for (const Offer& o : offers) {
        offered.push_back(o.path);
        EXPECT_TRUE(o.shortNameNull);
    }
    EXPECT_EQ(joined(offered), joined(expected));
}

TEST(FsBuild, ExpressionDecidesWhichOfferedFilesAreWritten) {
    Tree tree;
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(L"[SIZE] > 0 && [FILENAME]==\"*.txt\"", true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, tree.root, true, includes, excludes), 0);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    std::set<std::string> want{tree.root + "/a.txt", tree.root + "/sub/b.txt",
                               tree.root + "/sub/deeper/c.txt"};
    if (runningAsRoot()) want.insert(tree.root + "/locked/hidden.txt");
    EXPECT_EQ(got, want);
    // Every file was still offered; only the answer differs.
    std::vector<std::string> expected;
    expectedOrder(tree.root, expected);
    EXPECT_EQ(offers.size(), expected.size());
}

TEST(FsBuild, ZeroBudgetTimesOutAtOnceWithNothingRead) {
    Tree tree;
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, tree.root, true, includes, excludes, 0), 2);
    EXPECT_TRUE(writer.paths.empty());
    EXPECT_TRUE(capture.contains("::fs_scan - fs scanning timed out (timeout)"));
    EXPECT_FALSE(capture.contains("scandir"));
}

TEST(FsBuild, SpentBudgetStopsEveryLevelWithResultTwo) {
    TempDir dir;
    // Two sibling trees; whichever is visited first costs well over a
    // millisecond (an MD5 pass over 8 MB), so the second starts out of time.
    std::string big(8 * 1024 * 1024, 'x');
    dir.write("one/big", big);
    dir.write("two/big", big);
    dir.write("one/small", "s");
    dir.write("two/small", "s");
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true, 0x20, nullptr);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, dir.path(), true, includes, excludes, 1), 2);
    EXPECT_TRUE(capture.contains("::fs_scan - fs scanning timed out (timeout)"));
    EXPECT_LE(writer.paths.size(), 2u);
}

TEST(FsBuild, SingleDirectoryIsNeverInterruptedByTheBudget) {
    TempDir dir;
    std::string big(4 * 1024 * 1024, 'x');
    for (int i = 0; i < 4; ++i) dir.write("f" + std::to_string(i), big);
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true, 0x20, nullptr);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, dir.path(), true, includes, excludes, 1), 0);
    EXPECT_EQ(writer.paths.size(), 4u);
}

TEST(FsBuild, ChecksumsFollowProcessingFlagsAndLinksCarryThePreviousSums) {
    TempDir dir;
    dir.write("abc", "abc");
    dir.write("def", "def");
    symlink("abc", dir.file("l1").c_str());
    symlink("def", dir.file("l2").c_str());
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true, 0x40 | 0x80, nullptr);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes);
    ASSERT_EQ(offers.size(), 4u);
    const Offer* previous = nullptr;
    for (const Offer& o : offers) {
        EXPECT_EQ(o.flags, FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32);
        std::string name = o.path.substr(o.path.rfind('/') + 1);
        if (name == "abc") {
            EXPECT_TRUE(o.valid);
            EXPECT_EQ(o.crc32, 0x352441c2u);
            EXPECT_EQ(o.q32, 0x352441c2u);
        } else if (name == "def") {
            EXPECT_EQ(o.crc32, 0x0cc4e161u);
        } else if (previous != nullptr) {
            // A link's content is never read: the sums of the file before it stay.
            EXPECT_EQ(o.crc32, previous->crc32) << name;
            EXPECT_EQ(o.valid, previous->valid) << name;
        } else {
            EXPECT_FALSE(o.valid);
            EXPECT_EQ(o.crc32, 0u);
        }
        previous = &o;
    }
}

TEST(FsBuild, TwoArgumentProcessorAsksForNoChecksum) {
    TempDir dir;
    dir.write("abc", "abc");
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    EXPECT_EQ(processor.processingFlags, 0x1fu);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes);
    ASSERT_EQ(offers.size(), 1u);
    EXPECT_EQ(offers[0].flags, 0u);
    EXPECT_FALSE(offers[0].valid);
    EXPECT_EQ(offers[0].crc32, 0u);
}

TEST(FsBuild, MD5FlagRequestsMD5Only) {
    TempDir dir;
    dir.write("abc", "abc");
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true, 0x20, nullptr);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes);
    ASSERT_EQ(offers.size(), 1u);
    EXPECT_EQ(offers[0].flags, FILE_CHECKSUM_MD5);
    EXPECT_TRUE(offers[0].valid);
}

TEST(FsBuild, EmptyDirectoryOffersNothing) {
    TempDir dir;
    ObserverScope observer;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, dir.path(), true, includes, excludes), 0);
    EXPECT_TRUE(offers.empty());
    EXPECT_TRUE(writer.paths.empty());
}

TEST(FsBuild, DfsDriveOnThisPlatformIsLocal) {
    TempDir dir;
    dir.write("x", "1");
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes, kBudget,
         DriveInfo(L"/:", dtLocal, L"dfs"));
    EXPECT_EQ(writer.paths.size(), 1u);
    EXPECT_TRUE(capture.contains("::fs_scan - get a path on 'dfs' filesystem"));
    EXPECT_TRUE(capture.contains("::fs_scan - fset value for '" + dir.path() + "' path is NULL"));
    EXPECT_TRUE(capture.contains("::fs_scan - isLocal value for '" + dir.path() + "' path is true"));
    EXPECT_TRUE(capture.contains("::fs_scan - bAddRecord value for '" + dir.path() + "' path is true"));

    RecordingWriter remoteWriter;
    walk(remoteWriter, processor, dir.path(), true, includes, excludes, kBudget,
         DriveInfo(L"/:", dtRemote, L"dfs"));
    EXPECT_TRUE(remoteWriter.paths.empty());
    EXPECT_TRUE(capture.contains("::fs_scan - bAddRecord value for '" + dir.path() + "' path is false"));
}

TEST(FsBuild, NonDfsDriveRecordsWhateverItsType) {
    TempDir dir;
    dir.write("x", "1");
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes, kBudget,
         DriveInfo(L"/:", dtRemote, L"nfs"));
    EXPECT_EQ(writer.paths.size(), 1u);
    EXPECT_FALSE(capture.contains("dfs"));
}

// ------------------------------------------------------------- path limits

namespace {

// Makes a directory chain under base whose full path has exactly length
// characters; returns it.
std::string deepDirectory(const std::string& base, size_t length) {
    std::string path = base;
    while (path.size() < length) {
        size_t room = length - path.size() - 1;  // minus the separator
        size_t part = std::min<size_t>(200, room);
        if (room > 200 && room - 200 < 2) part = room - 2;  // leave room for one more part
        path += "/" + std::string(part, 'd');
        mkdir(path.c_str(), 0755);
    }
    return path;
}

}  // namespace

TEST(FsBuild, TreeWithPathsAroundTheLimitMatchesFindUpTo4095Characters) {
    TempDir dir;
    dir.write("top.txt", "t");
    std::string at4093 = deepDirectory(dir.path(), 4093);
    ASSERT_EQ(at4093.size(), 4093u);
    int dirFd = open(at4093.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(dirFd, 0);
    for (const char* name : {"f", "gg"}) {  // full paths of 4095 and 4096 characters
        int fd = openat(dirFd, name, O_CREAT | O_WRONLY, 0644);
        ASSERT_GE(fd, 0);
        close(fd);
    }
    // A directory of exactly 4095 characters is entered, but nothing in it fits.
    ASSERT_EQ(mkdirat(dirFd, "h", 0755), 0);
    int fd = openat(dirFd, "h/i", O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    close(fd);
    close(dirFd);

    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, dir.path(), true, includes, excludes), 0);
    std::set<std::string> fromWalk(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(fromWalk.size(), writer.paths.size());

    std::string found = testsupport::runCommand("find '" + dir.path() + "' -mindepth 1 ! -type d 2>/dev/null");
    std::set<std::string> fromFind;
    std::istringstream lines(found);
    std::string line;
    size_t seen = 0;
    while (std::getline(lines, line)) {
        ++seen;
        if (line.size() <= 4095) fromFind.insert(line);
    }
    EXPECT_EQ(seen, 4u);  // find itself lists all four files
    EXPECT_EQ(fromWalk, fromFind);
    EXPECT_EQ(fromWalk, (std::set<std::string>{dir.path() + "/top.txt", at4093 + "/f"}));
}

TEST(FsScan, PathOf4095CharactersIsAcceptedAnd4096IsRefused) {
    TempDir dir;
    std::string at4095 = deepDirectory(dir.path(), 4095);
    ASSERT_EQ(at4095.size(), 4095u);
    struct stat st;
    ASSERT_EQ(stat(at4095.c_str(), &st), 0);
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    PathDrive ok(wide(at4095).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(fs_scan(writer, processor, ok, includes, excludes, true, kBudget), 0);
    EXPECT_FALSE(capture.contains("path too long"));
    EXPECT_FALSE(capture.contains("scandir error"));

    std::string at4096 = at4095 + "x";
    PathDrive tooLong(wide(at4096).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(fs_scan(writer, processor, tooLong, includes, excludes, true, kBudget), 0);
    EXPECT_EQ(capture.count("::fs_scan - '" + at4096 + "' path too long"), 1u);
}

TEST(FsScan, EntryWhosePathWouldPassTheLimitIsSkippedSilently) {
    TempDir dir;
    std::string at4093 = deepDirectory(dir.path(), 4093);
    ASSERT_EQ(at4093.size(), 4093u);
    // 4093 + separator + 1 = 4095: kept; one more character: passed over.
    int dirFd = open(at4093.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(dirFd, 0);
    int fd = openat(dirFd, "f", O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    close(fd);
    fd = openat(dirFd, "gg", O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(fd, 0);
    close(fd);
    close(dirFd);
    TraceCapture capture;
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    PathDrive root(wide(at4093).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(fs_scan(writer, processor, root, includes, excludes, true, kBudget), 0);
    ASSERT_EQ(writer.paths, (std::vector<std::string>{at4093 + "/f"}));
    EXPECT_EQ(writer.paths[0].size(), 4095u);
    EXPECT_FALSE(capture.contains("gg"));
}

// ---------------------------------------------------------------- StringList

TEST(StringList, InsertFindAtClear) {
    StringList<char> list;
    EXPECT_EQ(list.size(), 0);
    EXPECT_TRUE(list.insert("alpha"));
    EXPECT_TRUE(list.insert("beta"));
    EXPECT_TRUE(list.insert("alpha"));
    EXPECT_FALSE(list.insert(nullptr));
    EXPECT_EQ(list.size(), 3);
    EXPECT_EQ(list.find("alpha"), 0);
    EXPECT_EQ(list.find("beta"), 1);
    EXPECT_EQ(list.find("gamma"), -1);
    EXPECT_STREQ(list.at(2), "alpha");
    EXPECT_EQ(list.at(3), nullptr);
    EXPECT_EQ(list.at(-1), nullptr);
    list.clear();
    EXPECT_EQ(list.size(), 0);
    StringList<wchar_t> wideList;
    wideList.insert(L"ELF");
    EXPECT_EQ(wideList.find(L"ELF"), 0);
    EXPECT_STREQ(wideList.at(0), L"ELF");
}

TEST(FileSystemHelper, HooksAreEmpty) {
    FileSystemHelper helper;
    StringList<char> list;
    EXPECT_EQ(helper.dfs_mount("/x"), nullptr);
    EXPECT_EQ(helper.dfs_hname(), nullptr);
    EXPECT_EQ(helper.load_dfs_local(nullptr, list), 0);
    EXPECT_EQ(helper.dfs_local("a", "b"), 0);
    EXPECT_EQ(list.size(), 0);
}

namespace {

// A distributed file system whose directories named "in..." lie on the local
// file set "fsLocal" and all others on "fsFar".
class FakeDfs : public FileSystemHelper::Backend {
public:
    char* dfs_mount(const char* path) override {
        ++mounts;
        const char* last = std::strrchr(path, '/');
        return const_cast<char*>(last != nullptr && std::strncmp(last, "/in", 3) == 0 ? "fsLocal" : "fsFar");
    }
    char* dfs_hname() override { return const_cast<char*>("host1"); }
    int load_dfs_local(char* host, StringList<char>& list) override {
        ++loads;
        EXPECT_STREQ(host, "host1");
        list.insert("fsLocal");
        return 0;
    }
    int dfs_local(const char* fileSet, const char*) override {
        ++localQuestions;
        return std::strcmp(fileSet, "fsLocal") == 0 ? 1 : 0;
    }
    int mounts = 0;
    int loads = 0;
    int localQuestions = 0;
};

}  // namespace

// The list of local file sets is tried once per process, so this one test
// pins the whole decision with a plugged-in back end.
TEST(FsBuild, DfsDecisionWithABackEndLoadsTheLocalListOnceAndFollowsIt) {
    TempDir dir;
    dir.write("top.txt", "t");
    dir.write("inner/local.txt", "l");
    dir.write("outer/far.txt", "f");
    FakeDfs dfs;
    FileSystemHelper::setBackend(&dfs);
    TraceCapture capture;
    RecordingWriter localWriter;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(localWriter, processor, dir.path(), true, includes, excludes, kBudget,
         DriveInfo(L"/:", dtLocal, L"dfs"));
    EXPECT_EQ(localWriter.paths, (std::vector<std::string>{dir.path() + "/inner/local.txt"}));
    EXPECT_EQ(dfs.mounts, 3);
    EXPECT_EQ(dfs.loads, 1);
    EXPECT_EQ(dfs.localQuestions, 1);  // asked only for the file set found in the list
    EXPECT_EQ(capture.count("FS_Cache::scan - load_dfs_local_retValue value is true: dfs local list loaded!"), 1u);
    EXPECT_EQ(capture.count("::fs_scan - 'fsLocal' found in dfs local list"), 1u);
    EXPECT_EQ(capture.count("::fs_scan - 'fsFar' not found in dfs local list"), 2u);
    EXPECT_TRUE(capture.contains("::fs_scan - fset value for '" + dir.path() + "/inner' path is fsLocal"));

    // A remote drive takes the opposite: files of non-local file sets.
    RecordingWriter remoteWriter;
    walk(remoteWriter, processor, dir.path(), true, includes, excludes, kBudget,
         DriveInfo(L"/:", dtRemote, L"dfs"));
    std::set<std::string> got(remoteWriter.paths.begin(), remoteWriter.paths.end());
    EXPECT_EQ(got, (std::set<std::string>{dir.path() + "/top.txt", dir.path() + "/outer/far.txt"}));
    EXPECT_EQ(dfs.loads, 1);
    FileSystemHelper::setBackend(nullptr);
}

namespace {

// A back end whose list of local file sets cannot be loaded: every file set
// must then be asked about on its own.
class UnloadableDfs : public FakeDfs {
public:
    int load_dfs_local(char*, StringList<char>& list) override {
        ++loads;
        list.insert("fsLocal");  // filled, yet not to be used: the load failed
        return 5;
    }
};

// Runs in a fresh process, where the one load attempt has not been made yet.
// Exits with 0 when every expectation holds, else prints what failed and
// exits with 1.
void walkWithUnloadableList() {
    std::string failed;
    {
        TempDir dir;
        dir.write("top.txt", "t");
        dir.write("inner/local.txt", "l");
        dir.write("outer/far.txt", "f");
        UnloadableDfs dfs;
        FileSystemHelper::setBackend(&dfs);
        TraceCapture capture;
        RecordingWriter writer;
        FileProcessor processor(kEveryFile, true);
        std::vector<PathInfo> includes, excludes;
        walk(writer, processor, dir.path(), true, includes, excludes, kBudget, DriveInfo(L"/:", dtLocal, L"dfs"));
        if (writer.paths != std::vector<std::string>{dir.path() + "/inner/local.txt"}) failed += "paths;";
        if (dfs.loads != 1) failed += "loads=" + std::to_string(dfs.loads) + ";";
        if (dfs.localQuestions != 3) failed += "questions=" + std::to_string(dfs.localQuestions) + ";";
        if (capture.count("FS_Cache::scan - load_dfs_local_retValue value is false: dfs local list not loaded!\n") != 1)
            failed += "not-loaded trace;";
        if (capture.contains("value is true: dfs local list loaded!")) failed += "loaded trace;";
        if (capture.contains("in dfs local list")) failed += "list looked up;";
        if (!capture.contains("::fs_scan - isLocal value for '" + dir.path() + "/outer' path is false"))
            failed += "isLocal trace;";
        // One attempt per process: a second walk does not try again.
        RecordingWriter again;
        walk(again, processor, dir.path(), true, includes, excludes, kBudget, DriveInfo(L"/:", dtLocal, L"dfs"));
        if (dfs.loads != 1) failed += "second load;";
        if (again.paths != writer.paths) failed += "second walk;";
        FileSystemHelper::setBackend(nullptr);
    }
    if (!failed.empty()) {
        fprintf(stderr, "failed: %s\n", failed.c_str());
        std::exit(1);
    }
    std::exit(0);
}

}  // namespace

TEST(FsBuildDeathTest, DfsListThatFailsToLoadLeavesEveryFileSetToTheLocalQuestion) {
    // The list is tried once per process: the child must start afresh.
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(walkWithUnloadableList(), ::testing::ExitedWithCode(0), "");
}

namespace {

// Unmounts on the way out, whatever the test did.
struct MountGuard {
    std::string point;
    bool mounted = false;
    ~MountGuard() {
        if (mounted) testsupport::runCommand("umount '" + point + "' 2>/dev/null");
    }
};

}  // namespace

TEST(FsBuild, MountPointsAreCrossedLikeAnyDirectory) {
    TempDir dir;
    dir.write("here.txt", "h");
    dir.mkdirs("mnt");
    MountGuard guard;
    guard.point = dir.file("mnt");
    int status = -1;
    testsupport::runCommand("mount -t tmpfs none '" + guard.point + "' 2>/dev/null", &status);
    if (status != 0) GTEST_SKIP() << "no permission to mount a file system here";
    guard.mounted = true;
    dir.write("mnt/there.txt", "t");
    struct stat outer, inner;
    ASSERT_EQ(lstat(dir.path().c_str(), &outer), 0);
    ASSERT_EQ(lstat(guard.point.c_str(), &inner), 0);
    ASSERT_NE(outer.st_dev, inner.st_dev);
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    walk(writer, processor, dir.path(), true, includes, excludes);
    std::set<std::string> got(writer.paths.begin(), writer.paths.end());
    EXPECT_EQ(got, (std::set<std::string>{dir.path() + "/here.txt", dir.path() + "/mnt/there.txt"}));
    // Only an exclude entry keeps the walk out.
    RecordingWriter excludedWriter;
    excludes.push_back(PathInfo(wide(guard.point).c_str(), true));
    walk(excludedWriter, processor, dir.path(), true, includes, excludes);
    EXPECT_EQ(excludedWriter.paths, (std::vector<std::string>{dir.path() + "/here.txt"}));
}

TEST(FsBuild, DeepestPossibleChainIsWalkedWithoutExhaustingTheStack) {
    TempDir dir;
    // One-character directories down to the path limit: about 2000 levels.
    int fd = open(dir.path().c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(fd, 0);
    size_t length = dir.path().size();
    int levels = 0;
    while (length + 2 + 2 <= 4095) {
        ASSERT_EQ(mkdirat(fd, "a", 0755), 0);
        int next = openat(fd, "a", O_RDONLY | O_DIRECTORY);
        ASSERT_GE(next, 0);
        close(fd);
        fd = next;
        length += 2;
        ++levels;
    }
    int file = openat(fd, "z", O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(file, 0);
    close(file);
    close(fd);
    ASSERT_GT(levels, 1000);
    RecordingWriter writer;
    FileProcessor processor(kEveryFile, true);
    std::vector<PathInfo> includes, excludes;
    EXPECT_EQ(walk(writer, processor, dir.path(), true, includes, excludes), 0);
    ASSERT_EQ(writer.paths.size(), 1u);
    EXPECT_EQ(writer.paths[0].size(), length + 2);
    EXPECT_EQ(writer.paths[0].substr(writer.paths[0].size() - 4), "/a/z");
}
