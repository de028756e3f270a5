// How the fsquery tool reads its PATH arguments: a path that exists is taken
// literally (a symbolic link followed, a ":" or "*" in a name kept as it is),
// any other path takes the library's path syntax, and a path that names no
// directory is an error; a path that is only a file is left out with a
// warning.  Also the warnings about --exclude and --cache-files that would
// otherwise answer nothing in silence.
//
// Every case runs in both modes, through a cache and with --no-cache, on a
// fixture tree with a mount table of its own ("/" the one local drive).
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


using testsupport::ToolRun;
using testsupport::runTool;

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

class FsQueryPaths : public ::testing::Test {
protected:
    void SetUp() override {
        tree = dir.mkdirs("tree");
        dir.write("tree/top.h", "q\n");
        dir.write("tree/a/x.c", "hi\n");
        dir.write("tree/a/b/y.c", "hello\n");
        dir.write("tree/co:lon/f.c", "colon\n");
        dir.write("tree/co:lon/in/g.c", "deeper\n");
        dir.write("tree/st*ar/s.c", "star\n");
        dir.write("tree/st*ar/in/u.c", "deeper\n");
        dir.write("tree/stXar/t.c", "not the star\n");
        dir.write("tree/st/mid/ar/v.c", "matched by the mask too\n");
        dir.write("tree/qu?st/q.c", "question\n");
        dir.write("tree/quXst/w.c", "not the question\n");
        EXPECT_EQ(0, symlink("a", path("a-link").c_str()));
        EXPECT_EQ(0, symlink("top.h", path("top-link.h").c_str()));
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
    }

    std::string path(const std::string& relative) const { return tree + "/" + relative; }
    std::set<std::string> paths(std::initializer_list<const char*> relative) const {
        std::set<std::string> result;
        for (const char* r : relative) result.insert(path(r));
        return result;
    }

    // The two modes of one query: through the fixture's cache, and without.
    std::vector<ToolRun> both(const std::vector<std::string>& query) {
        std::vector<ToolRun> runs;
        for (bool noCache : {false, true}) {
            std::vector<std::string> args = {"--mount-table", mtab};
            if (noCache) args.push_back("--no-cache");
            else args.insert(args.end(), {"--cache", dir.file("cache")});
            args.insert(args.end(), query.begin(), query.end());
            runs.push_back(runTool(dir, args));
        }
        return runs;
    }

    testsupport::TempDir dir;
    std::string tree;
    std::string mtab;
};

TEST_F(FsQueryPaths, SymbolicLinkGivenAsPathIsFollowed) {
    for (const ToolRun& r : both({"--name", "*.c", path("a-link")})) {
        EXPECT_EQ(0, r.status) << r.err;
        // Listed under the directory the link points to.
        EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), r.lineSet());
        EXPECT_EQ("", r.err);
    }
    // Inside a tree a link is listed, not followed.
    for (const ToolRun& r : both({"--name", "a-link", tree})) {
        EXPECT_EQ(paths({"a-link"}), r.lineSet());
    }
}

TEST_F(FsQueryPaths, PathThatIsNotADirectoryIsLeftOutWithAWarning) {
    for (const ToolRun& r : both({path("top.h")})) {
        EXPECT_EQ(0, r.status);
        EXPECT_EQ("", r.out);
        EXPECT_EQ("fsquery: warning: '" + path("top.h") + "' is not a directory: nothing below it is listed\n",
                  r.err);
    }
    // A link to a file is no directory either; the other path is answered.
    for (const ToolRun& r : both({"--name", "*.c", path("top-link.h"), path("a/b")})) {
        EXPECT_EQ(0, r.status);
        EXPECT_EQ(paths({"a/b/y.c"}), r.lineSet());
        EXPECT_TRUE(contains(r.err, "'" + path("top-link.h") + "' is not a directory")) << r.err;
    }
}

TEST_F(FsQueryPaths, PathSyntaxThatNamesNoDirectoryIsAUsageError) {
    const std::string missing = dir.file("nonexistent");
    struct Case {
        std::string given;
        std::string reason;
    };
    const std::vector<Case> cases = {
        {"$local::" + missing, "'" + missing + "' does not exist"},
        {"*:" + missing, "'" + missing + "' does not exist"},
        {"?:" + missing + "/*.c", "does not exist"},
        // The tree is no mount point: the named drive is no drive.
        {tree + ":" + path("a"), "no drive of the mount table answers it"},
        // No drive of this mount table is remote.
        {"$remote::" + tree, "no drive of the mount table answers it"},
    };
    for (const Case& c : cases) {
        for (const ToolRun& r : both({c.given})) {
            EXPECT_EQ(2, r.status) << c.given;
            EXPECT_EQ("", r.out);
            EXPECT_EQ(0u, r.err.find("fsquery: '" + c.given + "' names no directory: ")) << r.err;
            EXPECT_TRUE(contains(r.err, c.reason)) << r.err;
        }
    }
    // The path syntax that names a directory still works.
    for (const ToolRun& r : both({"--name", "*.c", "/:" + path("a")})) {
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), r.lineSet());
    }
}

TEST_F(FsQueryPaths, ExistingPathWithAColonInANameIsTakenLiterally) {
    for (const ToolRun& r : both({path("co:lon")})) {
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"co:lon/f.c", "co:lon/in/g.c"}), r.lineSet());
    }
    for (const ToolRun& r : both({"--non-recursive", path("co:lon"), path("a")})) {
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"co:lon/f.c", "a/x.c"}), r.lineSet());
    }
}

TEST_F(FsQueryPaths, ExistingPathWithAWildcardInANameIsTakenLiterally) {
    for (const ToolRun& r : both({path("st*ar")})) {
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"st*ar/s.c", "st*ar/in/u.c"}), r.lineSet());
    }
    for (const ToolRun& r : both({path("qu?st")})) {
        EXPECT_EQ(paths({"qu?st/q.c"}), r.lineSet());
    }
    // With other paths: each answers for itself.
    for (const ToolRun& r : both({"--name", "*.c", path("st*ar"), path("a")})) {
        EXPECT_EQ(paths({"st*ar/s.c", "st*ar/in/u.c", "a/x.c", "a/b/y.c"}), r.lineSet());
    }
    for (const ToolRun& r : both({"--non-recursive", path("st*ar")})) {
        EXPECT_EQ(paths({"st*ar/s.c"}), r.lineSet());
    }
    // A path that does not exist takes the path syntax: there a "*" is a mask.
    for (const ToolRun& r : both({path("st*r")})) {
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"st*ar/s.c", "st*ar/in/u.c", "stXar/t.c", "st/mid/ar/v.c"}), r.lineSet());
    }
}

TEST_F(FsQueryPaths, NameThatTheCachingSetCannotHoldIsWarnedAbout) {
    auto run = [&](std::vector<std::string> more) {
        std::vector<std::string> args = {"--mount-table", mtab, "--cache", dir.file("cache")};
        args.insert(args.end(), more.begin(), more.end());
        return runTool(dir, args);
    };
    ToolRun none = run({"--cache-files", "*.conf", "--name", "x.c", tree});
    EXPECT_EQ(0, none.status);
    EXPECT_EQ("", none.out);
    EXPECT_EQ("fsquery: warning: --name 'x.c' matches no file that the cache keeps (--cache-files '*.conf'): "
              "it answers nothing\n",
              none.err);
    ToolRun mask = run({"--cache-files", "*.conf", "--cache-files", "*.txt", "--name", "*.h", tree});
    EXPECT_TRUE(contains(mask.err, "--name '*.h' matches no file that the cache keeps (--cache-files '*.conf', "
                                   "'*.txt')"))
        << mask.err;
    // Names that a kept file can have: no warning.
    for (const std::vector<std::string>& ok : std::vector<std::vector<std::string>>{
             {"--cache-files", "*.c", "--name", "x.c"},
             {"--cache-files", "*.c", "--name", "x*"},
             {"--cache-files", "x*", "--name", "*.c"},
             {"--cache-files", "?.c", "--name", "*"},
             {"--cache-files", "x.c", "--name", "?.?"},
             {"--ignore-case", "--cache-files", "*.C", "--name", "X.c"}}) {
        std::vector<std::string> args = ok;
        args.push_back(tree);
        ToolRun r = run(args);
        EXPECT_EQ(0, r.status) << r.err;
        EXPECT_EQ("", r.err) << ok[1] << " " << ok[3];
        EXPECT_FALSE(r.out.empty());
    }
}

TEST_F(FsQueryPaths, ExcludeOfAFileIsWarnedAbout) {
    for (const ToolRun& r : both({"--exclude", path("a/x.c"), "--name", "x.c", tree})) {
        EXPECT_EQ(0, r.status);
        EXPECT_EQ(path("a/x.c") + "\n", r.out);
        EXPECT_EQ("fsquery: warning: --exclude '" + path("a/x.c") + "' is not a directory: it leaves nothing out\n",
                  r.err);
    }
}

TEST_F(FsQueryPaths, HelpTellsHowAPathIsRead) {
    ToolRun help = runTool(dir, {"--help"});
    EXPECT_EQ(0, help.status);
    EXPECT_TRUE(contains(help.out, "a path that exists is taken literally")) << help.out;
    EXPECT_TRUE(contains(help.out, "path syntax, for naming\ndrives (mount points) and media")) << help.out;
}

}  // namespace
