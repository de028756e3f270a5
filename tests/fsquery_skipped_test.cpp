// fsquery and the entries it cannot read: a directory it may not open, names
// that are not valid in its locale (with everything below a directory so
// named), paths past the limit of 4095 characters.  Each is told on standard
// error, one line per kind with the first paths, and the tool exits 1, as
// find does; --stats shows the counts.  Both the cache and the direct walk
// are run on fixture trees in temporary directories, with a mount table of
// their own.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {

const uid_t kNobody = 65534;

using testsupport::ToolRun;

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

std::string trimmed(const std::string& path) {
    std::string out = path;
    while (out.size() > 1 && out.back() == '/') out.pop_back();
    return out;
}

class SkippedEntries : public ::testing::Test {
protected:
    void SetUp() override {
        root = trimmed(dir.path());
        tree = dir.mkdirs("tree");
        dir.write("tree/a.c", "a\n");
        dir.write("tree/sub/b.c", "b\n");
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
        cache = dir.file("cache");
    }

    // Runs the tool on args after the fixture's mount table (and cache, unless
    // --no-cache is among them).  asNobody: the tool runs as an unprivileged
    // user when this test runs as root, for whom no permission bits apply.
    ToolRun run(std::vector<std::string> args, bool asNobody = false) {
        std::vector<std::string> all = {"--mount-table", mtab};
        if (std::find(args.begin(), args.end(), "--no-cache") == args.end()) {
            all.push_back("--cache");
            all.push_back(cache);
        }
        all.insert(all.end(), args.begin(), args.end());
        bool drop = asNobody && geteuid() == 0;
        if (drop) {
            // Everything the tool reads or writes becomes the user's.
            testsupport::runCommand("chown -R " + std::to_string(kNobody) + ":" + std::to_string(kNobody) + " '" +
                                    root + "'");
        }
        testsupport::ToolOptions options;
        options.env = {"LC_ALL=C.UTF-8"};
        if (drop) options.runAs = kNobody;
        return testsupport::runTool(dir, all, options);
    }

    void lockDirectory() {
        dir.write("tree/locked/hidden.c", "h\n");
        ASSERT_EQ(0, chmod((tree + "/locked").c_str(), 0));
    }
    // A file and a directory (with two files) whose names are not UTF-8.
    void undecodableNames() {
        dir.write("tree/lat1\xe9", "x\n");
        dir.write("tree/dir\xff/below1.c", "1\n");
        dir.write("tree/dir\xff/below2.c", "2\n");
    }
    // A chain of directories 4080 characters long, holding ok.c, a file and a
    // directory (with a file) whose paths pass 4095 characters.
    void pathsPastTheLimit() {
        chain = tree;
        while (chain.size() < 4080) {
            size_t room = 4080 - chain.size() - 1;
            size_t part = std::min<size_t>(200, room);
            if (room > 200 && room - 200 < 2) part = room - 2;
            chain += "/" + std::string(part, 'd');
            ASSERT_EQ(0, mkdir(chain.c_str(), 0755));
        }
        dir.write(chain.substr(root.size() + 1) + "/ok.c", "ok\n");
        int chainFd = open(chain.c_str(), O_RDONLY | O_DIRECTORY);
        ASSERT_GE(chainFd, 0);
        int fd = openat(chainFd, std::string(20, 'x').c_str(), O_CREAT | O_WRONLY, 0644);
        ASSERT_GE(fd, 0);
        close(fd);
        ASSERT_EQ(0, mkdirat(chainFd, std::string(20, 'y').c_str(), 0755));
        int deeper = openat(chainFd, std::string(20, 'y').c_str(), O_RDONLY | O_DIRECTORY);
        ASSERT_GE(deeper, 0);
        fd = openat(deeper, "under.c", O_CREAT | O_WRONLY, 0644);
        ASSERT_GE(fd, 0);
        close(fd);
        close(deeper);
        close(chainFd);
    }

    testsupport::TempDir dir;
    std::string root;
    std::string tree;
    std::string mtab;
    std::string cache;
    std::string chain;
};

const char kUnreadableOne[] =
    "fsquery: skipped 1 directory that could not be read, and everything below it: '";
const char kUndecodableTwo[] = "fsquery: skipped 2 entries whose names are not valid in the locale's encoding (";
const char kTooLongTwo[] =
    "fsquery: skipped 2 entries past the path limit of 4095 characters, and everything below them: ";

}  // namespace

TEST_F(SkippedEntries, UnreadableDirectoryIsToldAndTheCacheBuildExitsOne) {
    lockDirectory();
    ToolRun r = run({"--name", "*.c", tree}, true);
    if (r.status == 100) GTEST_SKIP() << "cannot drop privileges";
    EXPECT_EQ(1, r.status) << r.err;
    EXPECT_EQ(std::string(kUnreadableOne) + tree + "/locked' (Permission denied)\n", r.err);
    EXPECT_EQ((std::set<std::string>{tree + "/a.c", tree + "/sub/b.c"}), r.lineSet());
}

TEST_F(SkippedEntries, UnreadableDirectoryIsToldAndTheDirectWalkExitsOne) {
    lockDirectory();
    ToolRun r = run({"--no-cache", "--name", "*.c", tree}, true);
    if (r.status == 100) GTEST_SKIP() << "cannot drop privileges";
    EXPECT_EQ(1, r.status) << r.err;
    EXPECT_EQ(std::string(kUnreadableOne) + tree + "/locked' (Permission denied)\n", r.err);
    EXPECT_EQ((std::set<std::string>{tree + "/a.c", tree + "/sub/b.c"}), r.lineSet());
}

TEST_F(SkippedEntries, UndecodableNamesAreToldWithWhatIsBelowThemInBothModes) {
    // Before: nothing is skipped, nothing is said.  (A cache of its own: the
    // runs below must build theirs.)
    std::string laterCache = cache;
    cache = dir.file("cache-before");
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {"--name", "*", tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args);
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ("", r.err);
    }
    cache = laterCache;
    undecodableNames();
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {"--name", "*", tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args);
        SCOPED_TRACE(direct ? "direct walk" : "cache");
        EXPECT_EQ(1, r.status) << r.err;
        std::string line = r.errLine(kUndecodableTwo);
        ASSERT_FALSE(line.empty()) << r.err;
        EXPECT_TRUE(contains(line, "), and everything below them: ")) << line;
        EXPECT_TRUE(contains(line, "'" + tree + "/lat1\\xe9'")) << line;
        EXPECT_TRUE(contains(line, "'" + tree + "/dir\\xff'")) << line;
        EXPECT_EQ(1u, static_cast<size_t>(std::count(r.err.begin(), r.err.end(), '\n'))) << r.err;
        // Nothing below the directory so named is in the answer.
        EXPECT_EQ((std::set<std::string>{tree + "/a.c", tree + "/sub/b.c"}), r.lineSet());
    }
}

TEST_F(SkippedEntries, PathsPastTheLimitAreToldInBothModes) {
    pathsPastTheLimit();
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {"--name", "*.c", tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args);
        SCOPED_TRACE(direct ? "direct walk" : "cache");
        EXPECT_EQ(1, r.status) << r.err;
        std::string line = r.errLine(kTooLongTwo);
        ASSERT_FALSE(line.empty()) << r.err;
        EXPECT_TRUE(contains(line, "'" + chain + "/" + std::string(20, 'x') + "'")) << line;
        EXPECT_TRUE(contains(line, "'" + chain + "/" + std::string(20, 'y') + "'")) << line;
        EXPECT_EQ((std::set<std::string>{tree + "/a.c", tree + "/sub/b.c", chain + "/ok.c"}), r.lineSet());
    }
}

TEST_F(SkippedEntries, EntriesWithoutStatusAreToldInBothModes) {
    // A directory that may be listed but not searched.
    dir.write("tree/listonly/c.c", "c\n");
    dir.write("tree/listonly/inner/d.c", "d\n");
    ASSERT_EQ(0, chmod((tree + "/listonly").c_str(), 0644));
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {"--name", "*.c", tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args, true);
        if (r.status == 100) GTEST_SKIP() << "cannot drop privileges";
        SCOPED_TRACE(direct ? "direct walk" : "cache");
        EXPECT_EQ(1, r.status) << r.err;
        std::string line = r.errLine(
            "fsquery: skipped 2 entries whose status could not be read (kept as empty files), "
            "and everything below them: ");
        ASSERT_FALSE(line.empty()) << r.err;
        EXPECT_TRUE(contains(line, "'" + tree + "/listonly/c.c' (Permission denied)")) << line;
        EXPECT_TRUE(contains(line, "'" + tree + "/listonly/inner' (Permission denied)")) << line;
        EXPECT_EQ((std::set<std::string>{tree + "/a.c", tree + "/sub/b.c", tree + "/listonly/c.c"}), r.lineSet());
    }
}

TEST_F(SkippedEntries, StatsShowTheCountsAndTheDirectWalksRealDirectoryCount) {
    dir.mkdirs("tree/sub/deeper");
    dir.mkdirs("tree/empty");
    ToolRun clean = run({"--no-cache", "--stats", tree});
    EXPECT_EQ(0, clean.status) << clean.err;
    EXPECT_TRUE(contains(clean.err, "fsquery: scanned: 2 files\n")) << clean.err;
    EXPECT_TRUE(contains(clean.err, "fsquery: scanned: 3 directories\n")) << clean.err;
    EXPECT_TRUE(contains(clean.err, "fsquery: skipped: 0 unreadable directories, 0 undecodable names, "
                                    "0 past the path limit, 0 without status\n"))
        << clean.err;
    EXPECT_FALSE(contains(clean.err, "-1")) << clean.err;

    undecodableNames();
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {"--stats", tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args);
        SCOPED_TRACE(direct ? "direct walk" : "cache");
        EXPECT_EQ(1, r.status) << r.err;
        EXPECT_TRUE(contains(r.err, "fsquery: skipped: 0 unreadable directories, 2 undecodable names, "
                                    "0 past the path limit, 0 without status\n"))
            << r.err;
        EXPECT_TRUE(contains(r.err, "fsquery: hits: 2\n")) << r.err;
    }
}

TEST_F(SkippedEntries, NamesValidInTheLocalePrintAsTheyAreOnDisk) {
    // Names that mix ASCII runs with multibyte characters, in a directory so
    // named: printed byte for byte, from the cache and from the walk.
    dir.write("tree/caf\xc3\xa9/r\xc3\xa9sum\xc3\xa9-v2.txt", "r\n");
    dir.write("tree/caf\xc3\xa9/\xe2\x82\xac\xe2\x82\xac.c", "e\n");
    std::set<std::string> expected = {tree + "/a.c", tree + "/sub/b.c",
                                      tree + "/caf\xc3\xa9/r\xc3\xa9sum\xc3\xa9-v2.txt",
                                      tree + "/caf\xc3\xa9/\xe2\x82\xac\xe2\x82\xac.c"};
    for (bool direct : {false, true}) {
        std::vector<std::string> args = {tree};
        if (direct) args.insert(args.begin(), "--no-cache");
        ToolRun r = run(args);
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(expected, r.lineSet()) << (direct ? "direct walk" : "cache");
    }
}
