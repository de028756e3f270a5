// fsquery --sort killed while it sorts: the signal ends the tool, and no
// temporary file of the sort stays in the cache directory (the result file,
// named "sort-...", nor a scratch file of the sort beside it).
//
// The tree holds 200,000 files, so that the sort of their hits takes long
// enough to be caught: the test follows the tool's trace and sends SIGTERM
// the moment the sort begins.  A kill that comes too late (the trace already
// says the sort is done) proves nothing and the run is repeated, from the
// cache then; every run, caught or not, must leave the directory clean.
#include <fcntl.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"

namespace {

const std::string kTool = std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery";

// A tree of `directories` directories of `files` empty files each, created
// in an order unlike the order of their names, so that the sort has work.
void makeTree(const std::string& root, int directories, int files) {
    ASSERT_EQ(0, ::mkdir(root.c_str(), 0755));
    for (int d = 0; d < directories; ++d) {
        std::string dir = root + "/d" + std::to_string((d * 7919) % directories);
        ASSERT_EQ(0, ::mkdir(dir.c_str(), 0755)) << dir;
        for (int f = 0; f < files; ++f) {
            std::string name = dir + "/f" + std::to_string((f * 104729 + d) % 1000003) + ".dat";
            int fd = ::open(name.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
            ASSERT_GE(fd, 0) << name;
            ::close(fd);
        }
    }
}

// Names in a directory (recursively) that a sort leaves while it runs: the
// result file ("sort-..." in fsquery's cache, "fsq_..." from the library's
// fallback) and its scratch files.
std::vector<std::string> leftovers(const std::string& directory) {
    std::string listing = testsupport::runCommand("find '" + directory + "' -name 'sort-*' -o -name 'fsq_*'");
    std::vector<std::string> names;
    size_t start = 0;
    while (start < listing.size()) {
        size_t end = listing.find('\n', start);
        if (end == std::string::npos) end = listing.size();
        if (end > start) names.push_back(listing.substr(start, end - start));
        start = end + 1;
    }
    return names;
}

void sleepMilliseconds(long ms) {
    struct timespec t = {ms / 1000, (ms % 1000) * 1000000L};
    nanosleep(&t, nullptr);
}

// Waits up to `seconds` for the child to end; a child still there then is
// killed outright and reported as hanging (false).
bool waitBounded(pid_t pid, int* status, long seconds) {
    for (long waited = 0; waited < seconds * 1000; waited += 5) {
        if (waitpid(pid, status, WNOHANG) == pid) return true;
        sleepMilliseconds(5);
    }
    ::kill(pid, SIGKILL);
    waitpid(pid, status, 0);
    return false;
}

struct KilledRun {
    bool exited = false;    // the tool ended before it could be killed
    int signal = 0;         // the signal that ended it
    bool caught = false;    // the kill came while the sort ran
    bool hung = false;      // the tool did not end after the kill
};

// Where the tree and the cache go: a memory file system when the machine has
// one (200,000 files made and removed there cost little, and leave the
// disk's inode allocator alone), else the test's own directory.
class Workspace {
public:
    Workspace() {
        char pattern[] = "/dev/shm/fsq-kill-XXXXXX";
        if (::access("/dev/shm", W_OK) == 0 && ::mkdtemp(pattern) != nullptr) {
            fast = pattern;
        }
    }
    ~Workspace() {
        if (!fast.empty()) testsupport::removeTree(fast);
    }
    std::string file(const std::string& relative) const {
        return fast.empty() ? dir.file(relative) : fast + "/" + relative;
    }
    testsupport::TempDir dir;

private:
    std::string fast;
};

// Starts the tool with --sort on the tree, tracing at traceLevel into
// trace, its standard streams on /dev/null and its home, cache and
// temporary directories in dir; closeInChild (or -1) is a descriptor the
// tool must not hold.
pid_t startSort(const testsupport::TempDir& dir, const std::string& tree, const std::string& mtab,
                const std::string& cache, const std::string& trace, const char* traceLevel, int closeInChild) {
    pid_t pid = fork();
    if (pid == 0) {
        int null = ::open("/dev/null", O_RDWR);
        dup2(null, 0);
        dup2(null, 1);
        dup2(null, 2);
        if (closeInChild >= 0) ::close(closeInChild);
        setenv("HOME", dir.file("home").c_str(), 1);
        setenv("XDG_CACHE_HOME", dir.file("xdg").c_str(), 1);
        setenv("TMPDIR", dir.file("tmp").c_str(), 1);
        unsetenv("FSCANNER_TRACE_LEVEL");
        unsetenv("FSCANNER_TRACE_FILE");
        unsetenv("FSCANNER_CONFIG");
        testsupport::execBuildProgram({kTool, "--mount-table", mtab, "--cache", cache, "--trace", trace,
                                       "--trace-level", traceLevel, "--sort", "name", tree});
        _exit(98);
    }
    return pid;
}

// Starts the tool with --sort on the tree, waits for its trace to show the
// sort starting, sends it `signal` and waits for it.
KilledRun killDuringSort(const testsupport::TempDir& dir, const std::string& tree, const std::string& mtab,
                         const std::string& cache, const std::string& trace, int signal) {
    ::unlink(trace.c_str());
    pid_t pid = startSort(dir, tree, mtab, cache, trace, "2", -1);
    KilledRun run;
    const std::string started = "NaturalMergeSort::sort - entering";
    int status = 0;
    for (long waited = 0; waited < 600000; ++waited) {
        if (waitpid(pid, &status, WNOHANG) == pid) {
            run.exited = true;
            break;
        }
        if (testsupport::readFile(trace).find(started) != std::string::npos) {
            ::kill(pid, signal);
            break;
        }
        sleepMilliseconds(1);
    }
    if (!run.exited) run.hung = !waitBounded(pid, &status, 120);
    if (WIFSIGNALED(status) && !run.hung) run.signal = WTERMSIG(status);
    run.caught = !run.exited &&
                 testsupport::readFile(trace).find("FsResultSetReader_OnFile::sort - file sorted!") == std::string::npos;
    return run;
}

// What each test starts from: a tree of `directories` x `files` in the
// workspace, a mount table, the cache's place, and "tmp" for the tool's
// temporary files.
struct Scene {
    Workspace space;
    std::string tree;
    std::string mtab;
    std::string cache;
    Scene(int directories, int files) : tree(space.file("tree")), cache(space.file("cache")) {
        makeTree(tree, directories, files);
        mtab = space.dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
        space.dir.mkdirs("tmp");
    }
};

TEST(FsQuerySortKill, TwoHundredThousandFilesKilledDuringTheSortLeaveNoTemporaryFile) {
    Scene scene(400, 500);
    const testsupport::TempDir& dir = scene.space.dir;
    const std::string& tree = scene.tree;
    const std::string& mtab = scene.mtab;
    const std::string& cache = scene.cache;
    std::string trace = dir.file("trace.log");

    // A terminal that goes away (SIGHUP) and an interrupt end the tool as
    // the kill does.
    for (int signal : {SIGTERM, SIGHUP, SIGINT}) {
        int caught = 0;
        for (int attempt = 0; attempt < 5 && caught == 0; ++attempt) {
            KilledRun run = killDuringSort(dir, tree, mtab, cache, trace, signal);
            std::string where = "signal " + std::to_string(signal) + ", attempt " + std::to_string(attempt);
            ASSERT_FALSE(run.exited) << "the tool ended before its sort began (" << where << "):\n"
                                     << testsupport::readFile(trace);
            ASSERT_FALSE(run.hung) << "the tool did not end after the kill (" << where << ")";
            EXPECT_EQ(signal, run.signal) << where;
            EXPECT_EQ(std::vector<std::string>{}, leftovers(cache)) << where;
            EXPECT_EQ(std::vector<std::string>{}, leftovers(dir.file("tmp"))) << where;
            if (run.caught) ++caught;
        }
        EXPECT_EQ(1, caught) << "no kill with signal " << signal << " came while the sort ran";
    }
}

// A kill that comes while the tool waits to write a trace line, under the
// trace lock: the cleanup the signal runs traces too, and must not wait for
// that lock on the same thread.  The trace goes to a pipe nobody reads, so
// the tool stops inside a trace write once the pipe is full; the result file
// of its sort exists by then.
TEST(FsQuerySortKill, AKillWhileATraceLineWaitsEndsTheToolAndLeavesNoTemporaryFile) {
    Scene scene(300, 5);
    const testsupport::TempDir& dir = scene.space.dir;
    const std::string& cache = scene.cache;
    std::string fifo = dir.file("trace.fifo");
    ASSERT_EQ(0, ::mkfifo(fifo.c_str(), 0600));
    int reader = ::open(fifo.c_str(), O_RDONLY | O_NONBLOCK);
    ASSERT_GE(reader, 0);
    pid_t pid = startSort(dir, scene.tree, scene.mtab, cache, fifo, "3", reader);
    ASSERT_GT(pid, 0);
    // Full: what the pipe holds stops growing while the tool lives.
    int status = 0;
    bool ended = false;
    int held = -1, still = 0;
    for (long waited = 0; waited < 60000 && still < 60; waited += 5) {
        if (waitpid(pid, &status, WNOHANG) == pid) {
            ended = true;
            break;
        }
        int now = 0;
        ASSERT_EQ(0, ::ioctl(reader, FIONREAD, &now));
        still = (now > 0 && now == held) ? still + 1 : 0;
        held = now;
        sleepMilliseconds(5);
    }
    ASSERT_FALSE(ended) << "the tool ended before its trace filled the pipe";
    ASSERT_GE(held, 4096) << "the trace never filled the pipe";
    EXPECT_FALSE(leftovers(cache).empty()) << "no result file while the tool waits";
    ::kill(pid, SIGTERM);
    bool endedAfterKill = waitBounded(pid, &status, 20);
    ::close(reader);
    ASSERT_TRUE(endedAfterKill) << "the tool hangs in its signal handler";
    ASSERT_TRUE(WIFSIGNALED(status));
    EXPECT_EQ(SIGTERM, WTERMSIG(status));
    EXPECT_EQ(std::vector<std::string>{}, leftovers(cache));
    EXPECT_EQ(std::vector<std::string>{}, leftovers(dir.file("tmp")));
}

}  // namespace
