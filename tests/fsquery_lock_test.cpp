// The fsquery tool's own lock: runs on one cache take turns through the file
// "fsquery.lock" in the cache's directory, held with flock from before the
// cache object is made until after it is gone, and never removed.  The
// engine's lock file cannot do this alone: any lock object that goes away
// removes it, also the one of a run that gave up waiting, after which a third
// run locks a fresh file beside a build still in progress.
//
// Everything is observed from outside the tool: its exit status and output,
// the files of the cache directory, and flock attempts of this process on the
// lock file.  Each test has its own fixture tree, mount table ("/" is the one
// local drive) and cache directory in a temporary directory.
#include <errno.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <memory>
#include <set>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {


// Limits of the waits below: far above what any run needs, also under a
// 32-bit emulator on a loaded machine; they only keep a broken tool from
// hanging the suite.
const std::chrono::seconds kPatience(240);

using testsupport::ToolRun;
using Child = testsupport::ToolChild;
using testsupport::runTool;

// What this process sees when it asks for the lock without waiting.
enum class Probe { Missing, Held, Free };

Probe probeLock(const std::string& file) {
    int fd = open(file.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return Probe::Missing;
    Probe seen = Probe::Free;
    if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
        seen = (errno == EWOULDBLOCK) ? Probe::Held : Probe::Missing;
    }
    // Closing gives back a lock this process may have taken.
    close(fd);
    return seen;
}

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

std::string realPathOf(const std::string& path) {
    char* real = realpath(path.c_str(), nullptr);
    if (real == nullptr) return std::string();
    std::string result = real;
    std::free(real);
    return result;
}

class FsQueryLock : public ::testing::Test {
protected:
    void SetUp() override {
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
        cache = dir.file("cache");
        lockFile = cache + "/all/fsquery.lock";
    }

    // A tree of 2000 empty files whose cache build is held to a tiny share
    // of the CPU: it runs for seconds.
    std::string slowTree() {
        for (int i = 0; i < 2000; ++i) {
            std::string name = "slow/f" + std::to_string(i);
            dir.write(name, "");
            slowFiles.insert(dir.file(name));
        }
        return dir.file("slow");
    }

    std::vector<std::string> base(std::vector<std::string> more) const {
        std::vector<std::string> args = {"--mount-table", mtab, "--cache", cache};
        args.insert(args.end(), more.begin(), more.end());
        return args;
    }

    std::string timedOutMessage(int waitMs) const {
        return "fsquery: the cache " + realPathOf(cache + "/all") + " is locked by another process (waited " +
               std::to_string(waitMs) + " ms; see --lock-wait)\n";
    }

    testsupport::TempDir dir;
    std::string mtab;
    std::string cache;
    std::string lockFile;
    std::set<std::string> slowFiles;
};

// One run builds the cache slowly; two others, started while it holds the
// lock, give up waiting and come back until they get their turn.  The lock is
// seen held while the build runs, the build happens once, and every run that
// got its turn prints the whole tree.
TEST_F(FsQueryLock, RunsOnOneCacheTakeTurnsWhileOneBuildsSlowly) {
    std::string tree = slowTree();
    auto deadline = std::chrono::steady_clock::now() + kPatience;

    Child builder(dir, base({"--cpu", "1:200", "--stats", tree}));
    ASSERT_TRUE(builder.started());
    // The builder takes the lock before it makes its cache object; between
    // opening the file and taking the lock this probe may win, so it asks
    // again until it sees the lock held or the builder has ended.
    bool seenHeld = false;
    while (!seenHeld && !builder.poll() && std::chrono::steady_clock::now() < deadline) {
        if (probeLock(lockFile) == Probe::Held) seenHeld = true;
        else std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    EXPECT_TRUE(seenHeld) << "the slow run never held " << lockFile;

    // Two runs that wait 300 ms at a time and retry after each timeout.
    const std::vector<std::string> waiterArgs = base({"--lock-wait", "300", "--stats", tree});
    struct Waiter {
        std::unique_ptr<Child> child;
        int timeouts = 0;
        bool finished = false;
        ToolRun success;
    };
    Waiter waiters[2];
    for (Waiter& w : waiters) w.child.reset(new Child(dir, waiterArgs));
    bool builderDone = false;
    ToolRun built;
    while (std::chrono::steady_clock::now() < deadline) {
        if (!builderDone && builder.poll()) {
            builderDone = true;
            built = builder.wait();
        }
        bool allDone = builderDone;
        for (Waiter& w : waiters) {
            if (w.finished) continue;
            allDone = false;
            if (!w.child->poll()) continue;
            ToolRun r = w.child->wait();
            if (r.status == 7) {
                EXPECT_EQ(timedOutMessage(300), r.err);
                EXPECT_EQ("", r.out);
                ++w.timeouts;
                w.child.reset(new Child(dir, waiterArgs));
            } else {
                w.finished = true;
                w.success = r;
            }
        }
        if (allDone) break;
        std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    ASSERT_TRUE(builderDone) << "the slow run did not end";

    EXPECT_EQ(0, built.status) << built.err;
    EXPECT_TRUE(contains(built.err, "fsquery: roots: 0 served from the cache, 1 rebuilt\n")) << built.err;
    EXPECT_EQ(2000u, built.lines().size());
    EXPECT_EQ(slowFiles, built.lineSet());
    for (Waiter& w : waiters) {
        ASSERT_TRUE(w.finished) << "a waiting run never got its turn";
        // Started while the build held the lock, each gave up at least once.
        EXPECT_GE(w.timeouts, 1);
        EXPECT_EQ(0, w.success.status) << w.success.err;
        // Its turn came after the build: the tree is served, not built again.
        EXPECT_TRUE(contains(w.success.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n"))
            << w.success.err;
        EXPECT_EQ(2000u, w.success.lines().size());
        EXPECT_EQ(slowFiles, w.success.lineSet());
    }

    // One built copy of the tree: the files table's pointer file has one
    // 4-byte slot per record ever written, 2000 files once.
    struct stat st;
    ASSERT_EQ(0, stat((cache + "/all/files.pxx").c_str(), &st));
    EXPECT_EQ(8000, static_cast<long long>(st.st_size));
    ToolRun after = runTool(dir, base({"--stats", "--format", "null", tree}));
    EXPECT_EQ(0, after.status) << after.err;
    EXPECT_TRUE(contains(after.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n")) << after.err;
    EXPECT_TRUE(contains(after.err, "fsquery: hits: 2000\n")) << after.err;
    EXPECT_EQ(Probe::Free, probeLock(lockFile));
}

// The lock file is the tool's, not the engine's: it stays, the same file,
// after runs that succeeded, after one whose build was discarded with its
// cache, and after one that timed out waiting.
TEST_F(FsQueryLock, LockFileStaysAfterTheRuns) {
    dir.write("tree/a.c", "a\n");
    std::string tree = dir.file("tree");
    ToolRun first = runTool(dir, base({tree}));
    ASSERT_EQ(0, first.status) << first.err;
    struct stat st;
    ASSERT_EQ(0, stat(lockFile.c_str(), &st)) << "no lock file after a run";
    ino_t inode = st.st_ino;
    EXPECT_EQ(Probe::Free, probeLock(lockFile));

    ToolRun second = runTool(dir, base({tree}));
    ASSERT_EQ(0, second.status) << second.err;
    ASSERT_EQ(0, stat(lockFile.c_str(), &st));
    EXPECT_EQ(inode, st.st_ino);

    // A build that runs out of time discards the cache's files; the lock
    // file is not among them.  The tree above is served from the cache by
    // now (its extraction would time out instead): a tree not yet cached
    // is built.
    dir.write("other/b.c", "b\n");
    ToolRun discarded = runTool(dir, base({"--timeout", "0", dir.file("other")}));
    EXPECT_EQ(5, discarded.status) << discarded.err;
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/files.dat"));
    ASSERT_EQ(0, stat(lockFile.c_str(), &st));
    EXPECT_EQ(inode, st.st_ino);

    // A run that gave up waiting leaves the file to the holder.
    int fd = open(lockFile.c_str(), O_RDONLY | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, flock(fd, LOCK_EX | LOCK_NB));
    ToolRun gaveUp = runTool(dir, base({"--lock-wait", "200", tree}));
    EXPECT_EQ(7, gaveUp.status) << gaveUp.err;
    ASSERT_EQ(0, stat(lockFile.c_str(), &st));
    EXPECT_EQ(inode, st.st_ino);
    close(fd);

    ToolRun last = runTool(dir, base({tree}));
    ASSERT_EQ(0, last.status) << last.err;
    EXPECT_EQ(std::set<std::string>{dir.file("tree/a.c")}, last.lineSet());
    ASSERT_EQ(0, stat(lockFile.c_str(), &st));
    EXPECT_EQ(inode, st.st_ino);
}

// While another process holds the tool's lock, a run waits as long as
// --lock-wait says, then ends with the lock-timeout status and message
// without opening the cache; once the lock is free it runs.  A run without
// the cache takes no lock.
TEST_F(FsQueryLock, RunWhoseLockWaitTimesOutGivesTheLockTimeoutStatus) {
    dir.write("tree/a.c", "a\n");
    std::string tree = dir.file("tree");
    dir.mkdirs("cache/all");
    int fd = open(lockFile.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, flock(fd, LOCK_EX | LOCK_NB));

    ToolRun r = runTool(dir, base({"--lock-wait", "300", tree}));
    EXPECT_EQ(7, r.status);
    EXPECT_EQ(timedOutMessage(300), r.err);
    EXPECT_EQ("", r.out);
    // The cache was never opened.
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/files.dat"));
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/directories.dat"));

    ToolRun direct = runTool(dir, base({"--no-cache", "--lock-wait", "300", tree}));
    EXPECT_EQ(0, direct.status) << direct.err;
    EXPECT_EQ(std::set<std::string>{dir.file("tree/a.c")}, direct.lineSet());

    ASSERT_EQ(0, flock(fd, LOCK_UN));
    ToolRun after = runTool(dir, base({"--lock-wait", "300", tree}));
    EXPECT_EQ(0, after.status) << after.err;
    EXPECT_EQ(std::set<std::string>{dir.file("tree/a.c")}, after.lineSet());
    close(fd);
}

TEST_F(FsQueryLock, HelpNamesTheLockFile) {
    ToolRun r = runTool(dir, {"--help"});
    EXPECT_EQ(0, r.status);
    EXPECT_TRUE(contains(r.out, "fsquery.lock")) << r.out;
}

}  // namespace
