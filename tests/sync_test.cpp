#include "fscanner/fscommon/sync.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/time.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <string>
#include <thread>

#include "support/testsupport.h"

namespace {

long long elapsedMs(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration_cast<std::chrono::milliseconds>(std::chrono::steady_clock::now() - start).count();
}

// Keeps LinuxSharedMutex::storePath pointing into a temp dir for one test.
class StorePathFixture : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(saved, LinuxSharedMutex::storePath, sizeof saved);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(dir.path().c_str()));
    }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, saved, sizeof saved); }

    testsupport::TempDir dir;
    char saved[1024];
};

// A child process that takes the lock file and holds it until told to go.
class LockHolder {
public:
    explicit LockHolder(const std::string& path) {
        int ready[2];
        if (pipe(ready) != 0 || pipe(go) != 0) return;
        pid = fork();
        if (pid == 0) {
            int fd = ::open(path.c_str(), O_RDWR | O_CREAT, 0600);
            char ok = (fd != -1 && lockf(fd, F_LOCK, 0) == 0) ? 1 : 0;
            if (write(ready[1], &ok, 1) != 1) _exit(2);
            char c;
            if (read(go[0], &c, 1) < 0) _exit(3);
            _exit(0);
        }
        char ok = 0;
        held = read(ready[0], &ok, 1) == 1 && ok == 1;
        ::close(ready[0]);
        ::close(ready[1]);
    }
    ~LockHolder() { finish(); }
    void finish() {
        if (pid <= 0) return;
        char c = 1;
        if (write(go[1], &c, 1) != 1) kill(pid, SIGKILL);
        int status;
        waitpid(pid, &status, 0);
        ::close(go[0]);
        ::close(go[1]);
        pid = -1;
    }
    void killNow() {
        if (pid <= 0) return;
        kill(pid, SIGKILL);
        int status;
        waitpid(pid, &status, 0);
        ::close(go[0]);
        ::close(go[1]);
        pid = -1;
    }
    bool held = false;

private:
    int go[2];
    pid_t pid = -1;
};

// True when another process can take the lock on path at once.
bool otherProcessCanLock(const std::string& path) {
    pid_t pid = fork();
    if (pid == 0) {
        int fd = ::open(path.c_str(), O_RDWR);
        _exit(fd != -1 && lockf(fd, F_TLOCK, 0) == 0 ? 0 : 1);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// ---- setStorePath -------------------------------------------------------------

class SetStorePathTest : public ::testing::Test {
protected:
    void SetUp() override { std::memcpy(saved, LinuxSharedMutex::storePath, sizeof saved); }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, saved, sizeof saved); }
    char saved[1024];
};

TEST_F(SetStorePathTest, NullIsRefused) {
    ASSERT_TRUE(LinuxSharedMutex::setStorePath("/keep/"));
    EXPECT_FALSE(LinuxSharedMutex::setStorePath(nullptr));
    EXPECT_STREQ("/keep/", LinuxSharedMutex::storePath);
}

TEST_F(SetStorePathTest, PathEndingInSlashIsCopiedAsItStands) {
    EXPECT_TRUE(LinuxSharedMutex::setStorePath("/tmp/locks/"));
    EXPECT_STREQ("/tmp/locks/", LinuxSharedMutex::storePath);
}

TEST_F(SetStorePathTest, PathWithoutSlashGetsOneAppended) {
    EXPECT_TRUE(LinuxSharedMutex::setStorePath("/tmp/locks"));
    EXPECT_STREQ("/tmp/locks/", LinuxSharedMutex::storePath);
}

TEST_F(SetStorePathTest, SlashPathOf1023IsTakenAnd1024ReportsTrueButKeepsThePrevious) {
    std::string p1023 = std::string(1022, 'a') + "/";
    EXPECT_TRUE(LinuxSharedMutex::setStorePath(p1023.c_str()));
    EXPECT_EQ(p1023, std::string(LinuxSharedMutex::storePath));
    ASSERT_TRUE(LinuxSharedMutex::setStorePath("/prev/"));
    std::string p1024 = std::string(1023, 'b') + "/";
    EXPECT_TRUE(LinuxSharedMutex::setStorePath(p1024.c_str()));
    EXPECT_STREQ("/prev/", LinuxSharedMutex::storePath);
}

TEST_F(SetStorePathTest, PathWithoutSlashOf1022IsTakenAnd1023IsRefused) {
    std::string p1022(1022, 'c');
    EXPECT_TRUE(LinuxSharedMutex::setStorePath(p1022.c_str()));
    EXPECT_EQ(p1022 + "/", std::string(LinuxSharedMutex::storePath));
    ASSERT_TRUE(LinuxSharedMutex::setStorePath("/prev/"));
    std::string p1023(1023, 'd');
    EXPECT_FALSE(LinuxSharedMutex::setStorePath(p1023.c_str()));
    EXPECT_STREQ("/prev/", LinuxSharedMutex::storePath);
}

// ---- LinuxSharedMutex ---------------------------------------------------------

using LinuxSharedMutexTest = StorePathFixture;

TEST_F(LinuxSharedMutexTest, LockFileIsStorePathFollowedByTheName) {
    LinuxSharedMutex m("tbl_t_mutex");
    EXPECT_EQ(dir.path() + "/tbl_t_mutex", std::string(m.fileName()));
    EXPECT_NE(-1, m.descriptor());
    EXPECT_TRUE(testsupport::fileExists(dir.file("tbl_t_mutex")));
}

TEST_F(LinuxSharedMutexTest, WaitZeroTimesOutWithoutTouchingTheFile) {
    LinuxSharedMutex m("zero");
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-20, m.wait(0));
    EXPECT_EQ(-20, m.wait(-5));
    EXPECT_LT(elapsedMs(start), 50);
    // No lock was taken: another process gets it at once.
    EXPECT_TRUE(otherProcessCanLock(dir.file("zero")));
}

TEST_F(LinuxSharedMutexTest, WaitOneOnAFreeLockAcquires) {
    LinuxSharedMutex m("free");
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(0, m.wait(1));
    EXPECT_LT(elapsedMs(start), 50);
    EXPECT_FALSE(otherProcessCanLock(dir.file("free")));
    EXPECT_EQ(0, m.release());
    EXPECT_TRUE(otherProcessCanLock(dir.file("free")));
}

TEST_F(LinuxSharedMutexTest, WaitOneOnAHeldLockTimesOutAfterOneSleep) {
    LinuxSharedMutex m("held1");
    LockHolder holder(dir.file("held1"));
    ASSERT_TRUE(holder.held);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-20, m.wait(1));
    long long ms = elapsedMs(start);
    EXPECT_GE(ms, 95);
    EXPECT_LT(ms, 190);
}

TEST_F(LinuxSharedMutexTest, Wait101MakesTwoAttempts) {
    LinuxSharedMutex m("held2");
    LockHolder holder(dir.file("held2"));
    ASSERT_TRUE(holder.held);
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-20, m.wait(101));
    long long ms = elapsedMs(start);
    EXPECT_GE(ms, 195);
    EXPECT_LT(ms, 290);
    auto start2 = std::chrono::steady_clock::now();
    EXPECT_EQ(-20, m.wait(200));  // exactly two rounds as well
    ms = elapsedMs(start2);
    EXPECT_GE(ms, 195);
    EXPECT_LT(ms, 290);
}

TEST_F(LinuxSharedMutexTest, NoAttemptFollowsTheSleepOfTheLastRound) {
    // The holder lets go about 30 ms into the first round.  wait(1) has one
    // round: its only attempt came before the release, so it fails although
    // the lock is free when it returns.  wait(101) has a second attempt,
    // after the first sleep, and takes the lock.
    LinuxSharedMutex m("rounds");
    // Lets the holder go about 30 ms after start and notes when it did.
    auto releaseAfter30ms = [](LockHolder& holder, std::chrono::steady_clock::time_point start,
                               std::atomic<long long>& releasedAt) {
        return std::thread([&holder, start, &releasedAt] {
            std::this_thread::sleep_for(std::chrono::milliseconds(30));
            holder.finish();
            releasedAt = elapsedMs(start);
        });
    };
    {
        LockHolder holder(dir.file("rounds"));
        ASSERT_TRUE(holder.held);
        auto start = std::chrono::steady_clock::now();
        std::atomic<long long> releasedAt(-1);
        std::thread releaser = releaseAfter30ms(holder, start, releasedAt);
        EXPECT_EQ(-20, m.wait(1));
        long long returnedAt = elapsedMs(start);
        releaser.join();
        if (releasedAt.load() >= returnedAt) GTEST_SKIP() << "the release came too late to tell";
        EXPECT_TRUE(otherProcessCanLock(dir.file("rounds")));
    }
    {
        LockHolder holder(dir.file("rounds"));
        ASSERT_TRUE(holder.held);
        auto start = std::chrono::steady_clock::now();
        std::atomic<long long> releasedAt(-1);
        std::thread releaser = releaseAfter30ms(holder, start, releasedAt);
        int result = m.wait(101);
        long long ms = elapsedMs(start);
        releaser.join();
        if (releasedAt.load() >= 90) GTEST_SKIP() << "the release came too late to tell";
        EXPECT_EQ(0, result);
        EXPECT_GE(ms, 95);  // taken at the second attempt, after one sleep
        EXPECT_FALSE(otherProcessCanLock(dir.file("rounds")));
        EXPECT_EQ(0, m.release());
    }
}

TEST_F(LinuxSharedMutexTest, LockComesFreeWhenTheHoldingProcessDies) {
    LinuxSharedMutex m("dies");
    LockHolder holder(dir.file("dies"));
    ASSERT_TRUE(holder.held);
    EXPECT_EQ(-20, m.wait(1));
    holder.killNow();
    EXPECT_EQ(0, m.wait(1));
    EXPECT_EQ(0, m.release());
}

TEST_F(LinuxSharedMutexTest, TwoObjectsOfOneProcessDoNotExcludeEachOther) {
    LinuxSharedMutex a("same");
    LinuxSharedMutex b("same");
    EXPECT_EQ(0, a.wait(1));
    EXPECT_EQ(0, b.wait(1));
    EXPECT_EQ(0, b.wait());
}

TEST_F(LinuxSharedMutexTest, DestructorUnlinksTheLockFile) {
    {
        LinuxSharedMutex m("gone");
        EXPECT_TRUE(testsupport::fileExists(dir.file("gone")));
    }
    EXPECT_FALSE(testsupport::fileExists(dir.file("gone")));
}

TEST_F(LinuxSharedMutexTest, WithoutAFileEveryOperationFails) {
    LinuxSharedMutex nameless(nullptr);
    EXPECT_EQ(-1, nameless.descriptor());
    EXPECT_EQ(-21, nameless.wait());
    EXPECT_EQ(-21, nameless.wait(100));
    EXPECT_EQ(-1, nameless.release());
    EXPECT_EQ(-1, nameless.close());

    ASSERT_TRUE(LinuxSharedMutex::setStorePath(dir.file("no/such/dir").c_str()));
    LinuxSharedMutex unopened("x");
    EXPECT_EQ(-1, unopened.descriptor());
    EXPECT_EQ(-21, unopened.wait(0));
    EXPECT_EQ(-21, unopened.wait());
}

TEST_F(LinuxSharedMutexTest, CloseKeepsTheDescriptorValueAndLaterWaitsFail) {
    LinuxSharedMutex m("closed");
    int fd = m.descriptor();
    EXPECT_EQ(0, m.close());
    EXPECT_EQ(fd, m.descriptor());
    EXPECT_EQ(-21, m.wait(1));
}

// ---- deadline ---------------------------------------------------------------

TEST(SyncDeadlineTest, SubSecondMillisecondsAreAddedUnscaledSoTheWaitIsWholeSecondsPlusAboutOne) {
    for (long t : {500L, 2500L}) {
        struct timeval before;
        timespec d;
        // Retry until the clock is past the first millisecond of its second,
        // where the carry always fires.
        do {
            gettimeofday(&before, nullptr);
            d = syncDeadline(t);
        } while (before.tv_usec < 1000 || before.tv_usec > 998000);
        long long beforeUs = static_cast<long long>(before.tv_sec) * 1000000 + before.tv_usec;
        long long deadlineUs = static_cast<long long>(d.tv_sec) * 1000000 + d.tv_nsec / 1000;
        long long expected = (t / 1000 + 1) * 1000000LL;
        EXPECT_NEAR(static_cast<double>(expected), static_cast<double>(deadlineUs - beforeUs), 2000.0) << t;
        EXPECT_GE(d.tv_nsec, 0);
        EXPECT_LT(d.tv_nsec, 1000000000L);
    }
}

// ---- LinuxMutex ---------------------------------------------------------------

TEST(LinuxMutexTest, TwoObjectsOfOneNameExcludeEachOther) {
    LinuxMutex a("mutex_excl");
    LinuxMutex b("mutex_excl");
    EXPECT_EQ(a.sharedInfo(), b.sharedInfo());
    EXPECT_EQ(2u, a.sharedInfo()->refCount);
    EXPECT_TRUE(a.createdEntry());
    EXPECT_FALSE(b.createdEntry());
    ASSERT_EQ(0, a.wait());
    std::atomic<bool> got(false);
    std::thread t([&] {
        if (b.wait() == 0) got = true;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    EXPECT_FALSE(got.load());
    EXPECT_EQ(0, a.release());
    t.join();
    EXPECT_TRUE(got.load());
    b.release();
}

TEST(LinuxMutexTest, AfterBothObjectsAreDeletedANewOneStartsUnlockedWithCountOne) {
    {
        LinuxMutex a("mutex_life");
        LinuxMutex b("mutex_life");
        ASSERT_EQ(0, a.wait());
    }
    LinuxMutex c("mutex_life");
    EXPECT_TRUE(c.createdEntry());
    EXPECT_EQ(1u, c.sharedInfo()->refCount);
    EXPECT_EQ(0, c.sharedInfo()->locked);
    EXPECT_EQ(0, c.wait(1));
    c.release();
}

TEST(LinuxMutexTest, RegistryLivesFromFirstToLastObject) {
    unsigned int before = LinuxMutex::istances;
    {
        LinuxMutex a("reg_a");
        LinuxMutex b("reg_b");
        EXPECT_EQ(before + 2, LinuxMutex::istances);
        EXPECT_TRUE(LinuxMutex::mutexes);
        EXPECT_EQ(1u, LinuxMutex::mutexes_ptr()->count("reg_a"));
    }
    EXPECT_EQ(before, LinuxMutex::istances);
    if (before == 0) {
        EXPECT_FALSE(LinuxMutex::mutexes);
    }
}

TEST(LinuxMutexTest, ReleaseWithoutAHolderClearsTheFlagAndReturns) {
    LinuxMutex m("mutex_free_release");
    EXPECT_EQ(0, m.release());
    EXPECT_EQ(0, m.sharedInfo()->locked);
    EXPECT_EQ(0, m.wait(1));
    EXPECT_EQ(1, m.sharedInfo()->locked);
    EXPECT_EQ(0, m.release());
    EXPECT_EQ(0, m.sharedInfo()->locked);
}

TEST(LinuxMutexTest, TimedWaitOnAHeldMutexTimesOutAfterAboutASecond) {
    LinuxMutex a("mutex_timed");
    LinuxMutex b("mutex_timed");
    ASSERT_EQ(0, a.wait());
    auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(-20, b.wait(500));
    long long ms = elapsedMs(start);
    // 500 ms of timeout lasts about one second.
    EXPECT_GE(ms, 900);
    EXPECT_LT(ms, 1600);
    a.release();
}

TEST(LinuxMutexTest, TimedWaitAcquiresWhenReleasedInTime) {
    LinuxMutex a("mutex_timed2");
    LinuxMutex b("mutex_timed2");
    ASSERT_EQ(0, a.wait());
    std::thread t([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
        a.release();
    });
    EXPECT_EQ(0, b.wait(3000));
    t.join();
    b.release();
}

// ---- LinuxSemaphore and the library's semaphore functions ----------------------

TEST(LinuxSemaphoreTest, TimedWaitWithNothingPostedTimesOutThenOnePostGivesOneWait) {
    LinuxSemaphore s("sem_basic");
    EXPECT_EQ(-20, s.wait(100));
    EXPECT_EQ(0, s.release());
    EXPECT_EQ(-1, s.sharedInfo()->sem.counter);  // permits count negatively
    EXPECT_EQ(0, s.wait(100));
    EXPECT_EQ(0, s.sharedInfo()->sem.counter);
    EXPECT_EQ(-20, s.wait(100));
}

TEST(LinuxSemaphoreTest, ObjectsOfOneNameShareTheCounter) {
    LinuxSemaphore a("sem_shared");
    LinuxSemaphore b("sem_shared");
    EXPECT_EQ(a.sharedInfo(), b.sharedInfo());
    EXPECT_EQ(2u, a.sharedInfo()->refCount);
    EXPECT_EQ(0, a.release());
    EXPECT_EQ(0, b.wait());
}

TEST(LinuxSemaphoreTest, BlockingWaitReturnsAfterAPostFromAnotherThread) {
    LinuxSemaphore s("sem_thread");
    std::thread t([&] {
        std::this_thread::sleep_for(std::chrono::milliseconds(50));
        s.release();
    });
    EXPECT_EQ(0, s.wait());
    t.join();
}

TEST(LinuxSemaphoreTest, RegistryEntryGoesWithTheLastObject) {
    {
        LinuxSemaphore a("sem_life");
        a.release();
    }
    LinuxSemaphore b("sem_life");
    EXPECT_TRUE(b.createdEntry());
    EXPECT_EQ(0, b.sharedInfo()->sem.counter);
    EXPECT_EQ(1u, b.sharedInfo()->refCount);
}

TEST(SemaphoreFunctionsTest, CounterRunsNegativeAndAPositiveStartNeverBlocks) {
    _sem_t s;
    ASSERT_EQ(0, sem_init(&s, 0, 0));
    EXPECT_EQ(0, s.counter);
    EXPECT_EQ(0, sem_post(&s));
    EXPECT_EQ(-1, s.counter);
    EXPECT_EQ(0, sem_post(&s));
    EXPECT_EQ(-2, s.counter);
    EXPECT_EQ(0, sem_wait(&s));
    EXPECT_EQ(-1, s.counter);
    EXPECT_EQ(0, sem_destroy(&s));

    _sem_t p;
    ASSERT_EQ(0, sem_init(&p, 0, 2));
    EXPECT_EQ(0, sem_wait(&p));  // non-zero counter: no block, it moves away from 0
    EXPECT_EQ(3, p.counter);
    timespec past = {0, 0};
    EXPECT_EQ(0, sem_timedwait(&p, &past));
    EXPECT_EQ(0, sem_destroy(&p));
}

TEST(SemaphoreFunctionsTest, TimedWaitOnZeroTimesOut) {
    _sem_t s;
    ASSERT_EQ(0, sem_init(&s, 0, 0));
    timespec past = {1, 0};
    EXPECT_EQ(ETIMEDOUT, sem_timedwait(&s, &past));
    EXPECT_EQ(0, s.counter);
    EXPECT_EQ(0, sem_destroy(&s));
}

}  // namespace
