// One answer whatever the mode: the fsquery tool answers a query from its
// cache or, with --no-cache, by walking the tree directly, and both ways
// must print the same entries wherever the tool documents that they agree.
//
// Each case runs a table of queries twice over one fixture tree, once through
// a fresh cache and once with --no-cache, and compares the printed lines.
// The fixture's mount table makes two sub-directories mount points: "mnt" a
// local tmpfs (another file system than the tree's), "net" a remote nfs
// export, which both modes walk directly.  Nothing here depends on this
// machine's mounts, home or network.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {


using testsupport::ToolRun;
using testsupport::runTool;

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

const char kMd5OfHi[] = "764efa883dda1e11db47671c4a3bbd9e";  // "hi\n"

class FsQueryModes : public ::testing::Test {
protected:
    void SetUp() override {
        tree = dir.mkdirs("tree");
        dir.write("tree/top.h", "q\n");
        dir.write("tree/a/x.c", "hi\n");
        dir.write("tree/a/b/y.c", "hello\n");
        dir.write("tree/a/b/Upper.C", "upper case\n");
        dir.write("tree/c/z.txt", "z\n");
        dir.write("tree/c/big.bin", std::string(5000, 'b'));
        dir.write("tree/lib/l1.h", "l1\n");
        dir.write("tree/lib64/l2.h", "l2\n");
        dir.write("tree/mnt/inner.c", "inner\n");
        dir.write("tree/mnt/deep/d.h", "d\n");
        dir.write("tree/net/remote.c", "remote\n");
        dir.write("tree/net/sub/r.h", "r\n");
        dir.mkdirs("tree/empty");
        // Entries that are no regular file: listed, never read.
        EXPECT_EQ(0, symlink("x.c", path("a/x-link.c").c_str()));
        EXPECT_EQ(0, symlink("a", path("a-dir-link").c_str()));
        EXPECT_EQ(0, mkfifo(path("c/pipe").c_str(), 0600));
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n"
                                 "tmpfs " + path("mnt") + " tmpfs rw 0 0\n"
                                 "srv:/export " + path("net") + " nfs rw 0 0\n");
    }

    std::string path(const std::string& relative) const { return tree + "/" + relative; }

    // The query through a cache of its own (built by this run), and without.
    ToolRun cached(const std::vector<std::string>& query) {
        std::vector<std::string> args = {"--mount-table", mtab, "--cache", dir.file("cache" + std::to_string(++caches))};
        args.insert(args.end(), query.begin(), query.end());
        return runTool(dir, args);
    }
    ToolRun direct(const std::vector<std::string>& query) {
        std::vector<std::string> args = {"--mount-table", mtab, "--no-cache"};
        args.insert(args.end(), query.begin(), query.end());
        return runTool(dir, args);
    }

    // Runs every query both ways; each must succeed and print the same lines
    // in both modes, each line once.
    void expectOneAnswer(const std::vector<std::vector<std::string>>& table) {
        for (const std::vector<std::string>& query : table) {
            std::string text;
            for (const std::string& word : query) text += " '" + word + "'";
            ToolRun fromCache = cached(query);
            ToolRun walked = direct(query);
            EXPECT_EQ(0, fromCache.status) << text << "\n" << fromCache.err;
            EXPECT_EQ(0, walked.status) << text << "\n" << walked.err;
            std::vector<std::string> a = fromCache.sortedLines();
            std::vector<std::string> b = walked.sortedLines();
            EXPECT_EQ(a, b) << "the modes disagree on" << text;
            EXPECT_TRUE(std::adjacent_find(b.begin(), b.end()) == b.end()) << "a line twice without the cache:" << text;
            EXPECT_TRUE(std::adjacent_find(a.begin(), a.end()) == a.end()) << "a line twice from the cache:" << text;
        }
    }

    testsupport::TempDir dir;
    std::string tree;
    std::string mtab;
    int caches = 0;
};

// Paths: a tree with mounts inside, a path that is itself a mount point,
// paths that overlap, a path nested in another, and a remote tree.
TEST_F(FsQueryModes, PathsGiveOneAnswerInBothModes) {
    expectOneAnswer({
        {tree},
        {path("mnt")},
        {tree, path("a")},
        {path("a"), tree},
        {path("a/b"), path("a")},
        {path("lib"), path("lib64")},
        {path("net")},
        {tree, path("net")},
        {"--non-recursive", tree},
        {"--non-recursive", path("a"), path("mnt")},
        {"$local::" + tree},
        {"*:" + path("a")},
        {path("mnt") + ":" + path("mnt")},
    });
    // The mount point alone: every file once, not once per drive.
    ToolRun mountPoint = direct({path("mnt")});
    EXPECT_EQ((std::vector<std::string>{path("mnt/deep/d.h"), path("mnt/inner.c")}), mountPoint.sortedLines());
}

// Excludes leave directories out; a file named by an exclude stays, in both
// modes, and so does a file whose own name a wildcard exclude matches.
TEST_F(FsQueryModes, ExcludesGiveOneAnswerInBothModes) {
    expectOneAnswer({
        {"--exclude", tree, tree},
        {"--exclude", path("a"), tree},
        {"--exclude", path("a/x.c"), tree},
        {"--exclude", path("a") + "*", tree},
        {"--exclude", path("lib"), tree},
        {"--exclude", path("mnt"), tree},
        {"--exclude", path("mnt/deep"), path("mnt")},
        {"--exclude", path("a"), path("a")},
        {"--exclude", "*/b", tree},
        {"--exclude-fs", "tmpfs", tree},
        {"--include-fs", "tmpfs", tree},
    });
    ToolRun root = direct({"--exclude", tree, tree});
    EXPECT_EQ("", root.out);
    ToolRun file = direct({"--exclude", path("a/x.c"), "--name", "x.c", tree});
    EXPECT_EQ(path("a/x.c") + "\n", file.out);
}

// Names, expressions, case, checksums and the known-checksum filter.
TEST_F(FsQueryModes, SelectionsGiveOneAnswerInBothModes) {
    expectOneAnswer({
        {"--name", "*.c", tree},
        {"--name", "x*", tree},
        {"--ignore-case", "--name", "*.C", tree},
        {"-e", "[SIZE]>5", tree},
        {"-e", "[SIZE]>5", "--name", "*.c", tree},
        {"--known-md5", kMd5OfHi, tree},
        {"--known-md5", kMd5OfHi, path("net")},
        {"--md5", tree},
        {"--md5", "--crc32", "--q32", "--name", "*.c", tree},
        {"--md5", path("net")},
        {"--format", "json", tree},
        {"--format", "json", "--md5", "--crc32", tree},
        {"--format", "csv", "--q32", tree},
        {"--sort", "name", tree},
    });
    // A link next to the file with the known sum has no sum of its own.
    ToolRun known = direct({"--known-md5", kMd5OfHi, tree});
    EXPECT_EQ(path("a/x.c") + "\n", known.out);
}

// Where the modes differ by design: without the cache PATHID, MD5, CRC32 and
// Q32 hold nothing, so an expression that reads them is refused there with
// its reason, while the cache answers it.
TEST_F(FsQueryModes, ExpressionThatOnlyTheCacheCanAnswerIsRefusedWithoutIt) {
    ToolRun md5 = cached({"--md5", "-e", std::string("[MD5]==\"") + kMd5OfHi + "\"", tree});
    ASSERT_EQ(0, md5.status) << md5.err;
    EXPECT_EQ(kMd5OfHi + std::string("  ") + path("a/x.c") + "\n", md5.out);
    ToolRun md5Direct = direct({"--md5", "-e", std::string("[MD5]==\"") + kMd5OfHi + "\"", tree});
    EXPECT_EQ(2, md5Direct.status);
    EXPECT_EQ("", md5Direct.out);
    EXPECT_TRUE(contains(md5Direct.err, "--no-cache cannot answer an expression that reads MD5")) << md5Direct.err;
    EXPECT_TRUE(contains(md5Direct.err, "--known-md5")) << md5Direct.err;

    ToolRun pathId = cached({"-e", "[PATHID]>0", tree});
    ASSERT_EQ(0, pathId.status) << pathId.err;
    EXPECT_EQ(cached({tree}).sortedLines(), pathId.sortedLines());
    ToolRun pathIdDirect = direct({"-e", "[PATHID]>0", tree});
    EXPECT_EQ(2, pathIdDirect.status);
    EXPECT_TRUE(contains(pathIdDirect.err, "reads PATHID")) << pathIdDirect.err;
    for (const char* column : {"CRC32", "Q32"}) {
        ToolRun r = direct({"-e", std::string("[") + column + "]==0", tree});
        EXPECT_EQ(2, r.status) << column;
        EXPECT_TRUE(contains(r.err, std::string("reads ") + column)) << r.err;
    }
    // The help says so.
    ToolRun help = runTool(dir, {"--help"});
    EXPECT_TRUE(contains(help.out, "--no-cache refuses an expression")) << help.out;
}

}  // namespace
