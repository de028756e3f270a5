// The directory walker on its own: the order of what a sink is told, and the
// skips a failing file system produces, through a fault-injecting Env.
#include <gtest/gtest.h>

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/walk.h"
#include "support/testsupport.h"

using fscanner::DirectoryWalker;
using fscanner::WalkDirectory;
using fscanner::WalkEntry;
using fscanner::WalkOptions;
using fscanner::WalkSkip;
using fscanner::WalkVisit;

namespace {

const char* skipName(WalkSkip why) {
    switch (why) {
        case WalkSkip::TimedOut: return "timed-out";
        case WalkSkip::PathTooLong: return "too-long";
        case WalkSkip::NotConvertible: return "not-convertible";
        case WalkSkip::ConvertedTooLong: return "converted-too-long";
        case WalkSkip::OutOfMemory: return "out-of-memory";
        case WalkSkip::Unreadable: return "unreadable";
        case WalkSkip::Undecodable: return "undecodable";
        case WalkSkip::Dot: return "dot";
        case WalkSkip::Excluded: return "excluded";
    }
    return "?";
}

std::string narrow(const wchar_t* text) {
    std::string out;
    for (; text != nullptr && *text != 0; ++text) out += static_cast<char>(*text);
    return out;
}

// Writes down every event as one line; descends into every real directory.
class RecordingSink : public fscanner::WalkSink {
public:
    std::vector<std::string> events;
    std::vector<int> errors;  // error of each skipDirectory

    void skipDirectory(const WalkDirectory& d, WalkSkip why, int error) override {
        events.push_back(std::string("skip-dir ") + skipName(why) + " " + narrow(d.pathName));
        errors.push_back(error);
    }
    void enterDirectory(const WalkDirectory& d) override { events.push_back("enter " + *d.narrowPath); }
    void directoryListed(const WalkDirectory& d) override { events.push_back("listed " + *d.narrowPath); }
    void skipEntry(const WalkDirectory&, const WalkEntry& e, WalkSkip why) override {
        events.push_back(std::string("skip ") + skipName(why) + " " + e.name);
    }
    WalkVisit visitEntry(const WalkDirectory&, const WalkEntry& e, FsFileInfo& info, bool known) override {
        unsigned int attr = info.getAttr();
        events.push_back(std::string("seen ") + e.name + (known ? "" : " unknown") +
                         ((attr & FsFileInfo::ATTR_DIRECTORY) ? " dir" : ""));
        WalkVisit visit;
        visit.descend = known && !e.dot && (attr & FsFileInfo::ATTR_DIRECTORY) != 0 &&
                        (attr & FsFileInfo::ATTR_SYMLINK) == 0;
        return visit;
    }
    void leaveDirectory(const WalkDirectory& d, int result) override {
        events.push_back("leave " + *d.narrowPath + " " + std::to_string(result));
    }
};

// Counts the status calls and fails the ones it is told to.
class FaultyEnv : public fscanner::EnvWrapper {
public:
    FaultyEnv() : EnvWrapper(fscanner::Env::Default()) {}
    std::string failStatusOf;      // entry name whose fstatat fails
    std::string failLinkStatusOf;  // path suffix whose lstat fails
    std::string failOpenOf;        // directory path whose open fails
    int statusAtCalls = 0;
    int linkStatusCalls = 0;

    int statusAt(int fd, const char* name, struct stat* result, int flags) override {
        ++statusAtCalls;
        if (name == failStatusOf) {
            errno = EACCES;
            return -1;
        }
        return EnvWrapper::statusAt(fd, name, result, flags);
    }
    int linkStatus(const char* path, struct stat* result) override {
        ++linkStatusCalls;
        std::string p(path);
        if (!failLinkStatusOf.empty() && p.size() >= failLinkStatusOf.size() &&
            p.compare(p.size() - failLinkStatusOf.size(), failLinkStatusOf.size(), failLinkStatusOf) == 0) {
            errno = EACCES;
            return -1;
        }
        return EnvWrapper::linkStatus(path, result);
    }
    int openFile(const char* path, int flags, mode_t mode) override {
        if (path == failOpenOf) {
            errno = EACCES;
            return -1;
        }
        return EnvWrapper::openFile(path, flags, mode);
    }
};

class InstalledEnv {
public:
    explicit InstalledEnv(fscanner::Env* env) { fscanner::Env::Install(env); }
    ~InstalledEnv() { fscanner::Env::Install(nullptr); }
};

char* conversionBlock = nullptr;
size_t conversionSize = 0;

WalkOptions cacheLikeOptions() {
    WalkOptions options;
    options.conversion = {&conversionBlock, &conversionSize};
    return options;
}

// Names of path in readdir order.
std::vector<std::string> readdirOrder(const std::string& path) {
    std::vector<std::string> names;
    DIR* dir = opendir(path.c_str());
    if (dir == nullptr) return names;
    while (dirent* e = readdir(dir)) names.push_back(e->d_name);
    closedir(dir);
    return names;
}

int walkTree(fscanner::WalkSink& sink, const WalkOptions& options, const std::string& root, int timeoutMs) {
    std::wstring wide(root.begin(), root.end());
    DriveInfo drive(L"/:", dtLocal, L"ext4");
    PathDrive path(wide.c_str(), true, drive);
    DirectoryWalker walker(sink, options);
    return walker.walk(path, timeoutMs, 1);
}

}  // namespace

TEST(DirectoryWalker, SinkHearsEnterListedEntriesInReverseReaddirOrderAndLeave) {
    testsupport::TempDir dir;
    dir.write("t/file", "x");
    dir.write("t/sub/inner", "y");
    std::string root = dir.file("t");
    RecordingSink sink;
    ASSERT_EQ(0, walkTree(sink, cacheLikeOptions(), root, 100000));

    std::vector<std::string> expected = {"enter " + root, "listed " + root};
    std::vector<std::string> order = readdirOrder(root);
    std::vector<std::string> subOrder = readdirOrder(root + "/sub");
    for (auto it = order.rbegin(); it != order.rend(); ++it) {
        if (*it == "sub") {
            expected.push_back("seen sub dir");
            expected.push_back("enter " + root + "/sub");
            expected.push_back("listed " + root + "/sub");
            for (auto s = subOrder.rbegin(); s != subOrder.rend(); ++s) {
                expected.push_back("seen " + *s + ((*s == "." || *s == "..") ? " dir" : ""));
            }
            expected.push_back("leave " + root + "/sub 0");
        } else {
            expected.push_back("seen " + *it + ((*it == "." || *it == "..") ? " dir" : ""));
        }
    }
    expected.push_back("leave " + root + " 0");
    EXPECT_EQ(expected, sink.events);
}

TEST(DirectoryWalker, DirectScanOptionsPassOverDotsLongNamesAndExcludesBeforeTheirStatus) {
    testsupport::TempDir dir;
    dir.write("t/keep", "x");
    dir.write("t/skipme/inner", "y");
    std::string root = dir.file("t");
    std::wstring excluded(root.begin(), root.end());
    excluded += L"/skipme";
    std::vector<PathInfo> excludes = {PathInfo(excluded.c_str(), true)};
    WalkOptions options = cacheLikeOptions();
    options.dotsBeforeStatus = true;
    options.lengthBeforeStatus = true;
    options.entryExcludes = &excludes;
    FaultyEnv env;
    InstalledEnv installed(&env);
    RecordingSink sink;
    ASSERT_EQ(0, walkTree(sink, options, root, 100000));

    std::vector<std::string> seen(sink.events.begin() + 2, sink.events.end() - 1);
    std::sort(seen.begin(), seen.end());
    EXPECT_EQ((std::vector<std::string>{"seen keep", "skip dot .", "skip dot ..", "skip excluded skipme"}), seen);
    EXPECT_EQ(1, env.statusAtCalls);  // keep only: no call for the dots or the excluded entry
    EXPECT_EQ(0, env.linkStatusCalls);
}

TEST(DirectoryWalker, EveryEntryOfASearchableTreeTakesExactlyOneStatusCallOnTheDescriptor) {
    testsupport::TempDir dir;
    dir.write("t/a", "1");
    dir.write("t/b", "2");
    dir.mkdirs("t/empty");
    dir.write("t/d/c", "3");
    FaultyEnv env;
    InstalledEnv installed(&env);
    RecordingSink sink;
    ASSERT_EQ(0, walkTree(sink, cacheLikeOptions(), dir.file("t"), 100000));
    // a, b, empty, d, d/c; the dots of t (searched), of d and of empty (ours,
    // searchable) need no call of their own.
    EXPECT_EQ(5, env.statusAtCalls);
    EXPECT_EQ(0, env.linkStatusCalls);
}

TEST(DirectoryWalker, FailedStatusCallFallsBackToTheFullPathAndReportsTheEntryUnknown) {
    testsupport::TempDir dir;
    dir.write("t/victim", "x");
    dir.write("t/fine", "y");
    FaultyEnv env;
    env.failStatusOf = "victim";
    env.failLinkStatusOf = "/victim";
    InstalledEnv installed(&env);
    RecordingSink sink;
    testsupport::TraceCapture trace;
    ASSERT_EQ(0, walkTree(sink, cacheLikeOptions(), dir.file("t"), 100000));
    EXPECT_NE(sink.events.end(), std::find(sink.events.begin(), sink.events.end(), "seen victim unknown"));
    EXPECT_NE(sink.events.end(), std::find(sink.events.begin(), sink.events.end(), "seen fine"));
    // The fallback is the full-path call with its trace, as a failure always was.
    EXPECT_TRUE(trace.contains("FsFileInfo::updateInfo - lstat(...) failed on '" + dir.file("t/victim") + "' path"))
        << trace.dump();
}

TEST(DirectoryWalker, StatusCallThatFailsOnTheDescriptorButNotOnThePathKeepsThePathsAnswer) {
    testsupport::TempDir dir;
    dir.write("t/flaky", "abc");
    FaultyEnv env;
    env.failStatusOf = "flaky";
    InstalledEnv installed(&env);
    RecordingSink sink;
    ASSERT_EQ(0, walkTree(sink, cacheLikeOptions(), dir.file("t"), 100000));
    EXPECT_NE(sink.events.end(), std::find(sink.events.begin(), sink.events.end(), "seen flaky"));
    EXPECT_EQ(1, env.linkStatusCalls);
}

TEST(DirectoryWalker, DirectoryThatCannotBeOpenedIsSkippedAsUnreadableBetweenEnterAndLeave) {
    testsupport::TempDir dir;
    dir.write("t/locked/hidden", "x");
    dir.write("t/open/shown", "y");
    std::string locked = dir.file("t/locked");
    FaultyEnv env;
    env.failOpenOf = locked;
    InstalledEnv installed(&env);
    RecordingSink sink;
    testsupport::TraceCapture trace;
    ASSERT_EQ(0, walkTree(sink, cacheLikeOptions(), dir.file("t"), 100000));

    auto enter = std::find(sink.events.begin(), sink.events.end(), "enter " + locked);
    ASSERT_NE(sink.events.end(), enter);
    EXPECT_EQ("skip-dir unreadable " + locked, *(enter + 1));
    EXPECT_EQ("leave " + locked + " 0", *(enter + 2));
    ASSERT_EQ(1u, sink.errors.size());
    EXPECT_EQ(EACCES, sink.errors[0]);
    EXPECT_TRUE(trace.contains("::scandir CAN'T OPEN " + locked + " dir, errno: 13 (")) << trace.dump();
    // The walk went on with the rest.
    EXPECT_NE(sink.events.end(), std::find(sink.events.begin(), sink.events.end(), "seen shown"));
    EXPECT_EQ(sink.events.end(), std::find(sink.events.begin(), sink.events.end(), "seen hidden"));
}

TEST(DirectoryWalker, SpentBudgetSkipsTheDirectoryWithoutEnteringIt) {
    testsupport::TempDir dir;
    dir.write("t/a", "x");
    RecordingSink sink;
    EXPECT_EQ(2, walkTree(sink, cacheLikeOptions(), dir.file("t"), 0));
    EXPECT_EQ((std::vector<std::string>{"skip-dir timed-out " + dir.file("t")}), sink.events);
}
