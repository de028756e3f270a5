// End-to-end tests of the fsquery tool: each test runs the built program on a
// fixture tree in a temporary directory, with a mount table of its own (the
// fixture declares "/" as the one local drive, and sometimes more) and a cache
// directory in the same temporary directory.  HOME and XDG_CACHE_HOME of the
// child point into the fixture too, so nothing here reads or writes the real
// home directory or depends on this machine's mounts.
#include <fcntl.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <ctime>
#include <cstring>
#include <fstream>
#include <map>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {

const std::string kTool = std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery";

using testsupport::ToolRun;
using testsupport::runTool;

// The fixture: a small tree with known contents, a mount table naming "/" as
// the only drive, and a cache directory.
class FsQueryTool : public ::testing::Test {
protected:
    void SetUp() override {
        tree = dir.mkdirs("tree");
        dir.write("tree/top.h", "q\n");
        dir.write("tree/a/x.c", "hi\n");
        dir.write("tree/a/b/y.c", "hello\n");
        dir.write("tree/a/b/Upper.C", "upper case\n");
        dir.write("tree/c/z.txt", "z\n");
        dir.write("tree/c/big.bin", std::string(5000, 'b'));
        dir.mkdirs("tree/empty");
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
        cache = dir.file("cache");
    }

    // Common arguments: the fixture's mount table and cache.
    std::vector<std::string> base(std::vector<std::string> more) const {
        std::vector<std::string> args = {"--mount-table", mtab, "--cache", cache};
        args.insert(args.end(), more.begin(), more.end());
        return args;
    }
    ToolRun query(std::vector<std::string> more) const { return runTool(dir, base(more)); }

    std::string path(const std::string& relative) const { return tree + "/" + relative; }

    std::set<std::string> paths(std::initializer_list<const char*> relative) const {
        std::set<std::string> result;
        for (const char* r : relative) result.insert(path(r));
        return result;
    }

    testsupport::TempDir dir;
    std::string tree;
    std::string mtab;
    std::string cache;
};

bool contains(const std::string& text, const std::string& part) {
    return text.find(part) != std::string::npos;
}

size_t countLines(const std::string& text) { return std::count(text.begin(), text.end(), '\n'); }

// ------------------------------------------------------------- usage

TEST_F(FsQueryTool, HelpPrintsUsageAndExitsZero) {
    ToolRun r = runTool(dir, {"--help"});
    EXPECT_EQ(0, r.status);
    EXPECT_TRUE(contains(r.out, "usage: fsquery [OPTIONS] [PATH...]"));
    EXPECT_TRUE(contains(r.out, "--no-cache"));
    EXPECT_TRUE(contains(r.out, "7 cache locked by another process"));
    EXPECT_EQ("", r.err);
}

TEST_F(FsQueryTool, VersionPrintsOneLine) {
    ToolRun r = runTool(dir, {"--version"});
    EXPECT_EQ(0, r.status);
    EXPECT_EQ("fsquery 0.1.0\n", r.out);
}

TEST_F(FsQueryTool, UnknownOptionIsUsageErrorWithOneLineMessage) {
    ToolRun r = query({"--bogus", tree});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: unknown option '--bogus' (see fsquery --help)\n", r.err);
    EXPECT_EQ("", r.out);
    EXPECT_FALSE(testsupport::fileExists(cache));
}

TEST_F(FsQueryTool, OptionWithoutItsValueIsUsageError) {
    ToolRun r = query({tree, "--name"});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: option '--name' needs a value (see fsquery --help)\n", r.err);
}

TEST_F(FsQueryTool, BadNumbersAreUsageErrors) {
    ToolRun r = query({"--timeout", "12x", tree});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ(1u, countLines(r.err));
    EXPECT_TRUE(contains(r.err, "option '--timeout' needs a number"));
    EXPECT_EQ(2, query({"--trace-level", "4", tree}).status);
    EXPECT_EQ(2, query({"--max-age", "-1", tree}).status);
    EXPECT_EQ(2, query({"--cpu", "0:50", tree}).status);
    EXPECT_EQ(2, query({"--cpu", "50", tree}).status);
}

TEST_F(FsQueryTool, BadChoicesAreUsageErrors) {
    ToolRun r = query({"--format", "xml", tree});
    EXPECT_EQ(2, r.status);
    EXPECT_TRUE(contains(r.err, "option '--format' takes text, json, csv or null, not 'xml'"));
    EXPECT_EQ(2, query({"--sort", "date", tree}).status);
    EXPECT_EQ(2, query({"--reverse", tree}).status);
    EXPECT_EQ(2, query({"--no-cache", "--cache-files", "*.c", tree}).status);
    EXPECT_EQ(2, query({"--known-md5", "abc", tree}).status);
    EXPECT_EQ(2, query({"--name", "a\"b", tree}).status);
    EXPECT_EQ(2, query({"--stats=yes", tree}).status);
}

TEST_F(FsQueryTool, InvalidExpressionIsUsageErrorWithTheParsersReason) {
    ToolRun r = query({"-e", "[SIZE]>", tree});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: invalid expression '[SIZE]>' (unexpected sequence!)\n", r.err);
    ToolRun unknown = query({"-e", "[NOSUCH]==1", tree});
    EXPECT_EQ(2, unknown.status);
    EXPECT_TRUE(contains(unknown.err, "variable specified not found!"));
    ToolRun types = query({"-e", "[FILENAME]==1", tree});
    EXPECT_EQ(2, types.status);
    EXPECT_TRUE(contains(types.err, "relation operands of different types!"));
    EXPECT_FALSE(testsupport::fileExists(cache));
}

TEST_F(FsQueryTool, MissingPathIsUsageError) {
    ToolRun r = query({dir.file("nowhere")});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: '" + dir.file("nowhere") + "': No such file or directory\n", r.err);
}

// ------------------------------------------------------ cached queries

TEST_F(FsQueryTool, TextFormatPrintsEveryFileOnePathPerLine) {
    ToolRun r = query({tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"top.h", "a/x.c", "a/b/y.c", "a/b/Upper.C", "c/z.txt", "c/big.bin"}), r.lineSet());
    EXPECT_EQ(6u, r.lines().size());
    EXPECT_EQ("", r.err);
}

TEST_F(FsQueryTool, SecondRunIsServedFromTheCache) {
    ToolRun first = query({"--stats", "--name", "*.c", tree});
    ASSERT_EQ(0, first.status) << first.err;
    EXPECT_TRUE(contains(first.err, "fsquery: roots: 0 served from the cache, 1 rebuilt\n")) << first.err;
    EXPECT_TRUE(contains(first.err, "fsquery: scanned: 6 files, ")) << first.err;
    EXPECT_TRUE(contains(first.err, "fsquery: hits: 2\n"));
    ToolRun second = query({"--stats", "--name", "*.c", tree});
    ASSERT_EQ(0, second.status) << second.err;
    EXPECT_TRUE(contains(second.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n")) << second.err;
    EXPECT_TRUE(contains(second.err, "fsquery: scanned: 0 files, 0 directories\n")) << second.err;
    EXPECT_TRUE(contains(second.err, "fsquery: hits: 2\n"));
    EXPECT_EQ(first.lineSet(), second.lineSet());
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), second.lineSet());
    EXPECT_TRUE(testsupport::fileExists(cache + "/all/files.dat"));
    EXPECT_TRUE(testsupport::fileExists(cache + "/all/directories.dat"));
}

TEST_F(FsQueryTool, CacheServesTheOldTreeUntilItIsTooOld) {
    ASSERT_EQ(0, query({tree}).status);
    dir.write("tree/c/new.c", "new\n");
    // Young enough: the cache answers, without the new file.
    ToolRun served = query({"--stats", "--name", "*.c", tree});
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), served.lineSet());
    EXPECT_TRUE(contains(served.err, "1 served from the cache, 0 rebuilt"));
    sleep(1);
    ToolRun rebuilt = query({"--stats", "--max-age", "0", "--name", "*.c", tree});
    ASSERT_EQ(0, rebuilt.status) << rebuilt.err;
    EXPECT_TRUE(contains(rebuilt.err, "0 served from the cache, 1 rebuilt")) << rebuilt.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/new.c"}), rebuilt.lineSet());
}

TEST_F(FsQueryTool, ProviderChangeRebuildsTheTree) {
    ASSERT_EQ(0, query({tree}).status);
    ToolRun same = query({"--stats", tree});
    EXPECT_TRUE(contains(same.err, "1 served from the cache, 0 rebuilt"));
    ToolRun other = query({"--stats", "--provider", "other", tree});
    ASSERT_EQ(0, other.status) << other.err;
    EXPECT_TRUE(contains(other.err, "0 served from the cache, 1 rebuilt")) << other.err;
    EXPECT_EQ(6u, other.lines().size());
}

TEST_F(FsQueryTool, NameMaskSelectsMatchingFiles) {
    ToolRun r = query({"--name", "*.c", tree});
    ASSERT_EQ(0, r.status);
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), r.lineSet());
    ToolRun two = query({"--name", "*.c", "--name", "*.txt", tree});
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/z.txt"}), two.lineSet());
    ToolRun none = query({"--name", "*.nothing", tree});
    EXPECT_EQ(0, none.status);
    EXPECT_EQ("", none.out);
}

TEST_F(FsQueryTool, ExactNameIsAnsweredThroughTheIndex) {
    ToolRun r = query({"--stats", "--name", "y.c", tree});
    ASSERT_EQ(0, r.status);
    EXPECT_EQ(paths({"a/b/y.c"}), r.lineSet());
    EXPECT_TRUE(contains(r.err, "fsquery: lookup: index on FILENAME\n")) << r.err;
    ToolRun mask = query({"--stats", "--name", "y.*", tree});
    EXPECT_TRUE(contains(mask.err, "fsquery: lookup: every row\n"));
}

TEST_F(FsQueryTool, IgnoreCaseMatchesNamesInAnyCase) {
    ToolRun sensitive = query({"--name", "*.C", tree});
    EXPECT_EQ(paths({"a/b/Upper.C"}), sensitive.lineSet());
    ToolRun insensitive = query({"--ignore-case", "--name", "*.C", tree});
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "a/b/Upper.C"}), insensitive.lineSet());
}

TEST_F(FsQueryTool, ExpressionSelectsBySize) {
    ToolRun r = query({"-e", "[SIZE]>5", tree});
    ASSERT_EQ(0, r.status);
    EXPECT_EQ(paths({"a/b/y.c", "a/b/Upper.C", "c/big.bin"}), r.lineSet());
    // Blanks around the expression are the shell user's, not the language's.
    ToolRun blanks = query({"-e", " [SIZE]>1000 ", tree});
    EXPECT_EQ(paths({"c/big.bin"}), blanks.lineSet());
    // A name and an expression must both hold.
    ToolRun both = query({"--name", "*.c", "-e", "[SIZE]>5", tree});
    EXPECT_EQ(paths({"a/b/y.c"}), both.lineSet());
}

TEST_F(FsQueryTool, ExcludeLeavesTheSubtreeOut) {
    ToolRun r = query({"--exclude", path("a/b"), tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"top.h", "a/x.c", "c/z.txt", "c/big.bin"}), r.lineSet());
    ToolRun two = query({"--exclude", path("a"), "--exclude", path("c"), tree});
    EXPECT_EQ(paths({"top.h"}), two.lineSet());
}

TEST_F(FsQueryTool, NonRecursiveReportsOnlyTheFilesOfThePathItself) {
    ToolRun r = query({"--non-recursive", path("a")});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c"}), r.lineSet());
}

TEST_F(FsQueryTool, SeveralPathsAreAllIncluded) {
    ToolRun r = query({"--name", "*.*", path("a/b"), path("c")});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/b/y.c", "a/b/Upper.C", "c/z.txt", "c/big.bin"}), r.lineSet());
}

TEST_F(FsQueryTool, QueryPathSyntaxWithMediaAndDriveIsAccepted) {
    ToolRun media = query({"--name", "*.c", "$local::" + tree});
    ASSERT_EQ(0, media.status) << media.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), media.lineSet());
    ToolRun drive = query({"--name", "*.c", "/:" + path("a/b")});
    EXPECT_EQ(paths({"a/b/y.c"}), drive.lineSet());
    // No drive is remote in this mount table: the remote media names no
    // directory, which is a usage error naming the path.
    ToolRun remote = query({"$remote::" + tree});
    EXPECT_EQ(2, remote.status);
    EXPECT_EQ("fsquery: '$remote::" + tree + "' names no directory: no drive of the mount table answers it\n",
              remote.err);
    EXPECT_EQ("", remote.out);
}

TEST_F(FsQueryTool, FileSystemFiltersFollowTheMountTable) {
    dir.write("tree/mnt/inner.c", "inner\n");
    std::string table = dir.write("mtab2", "/dev/vda / ext4 rw 0 0\ntmpfs " + path("mnt") + " tmpfs rw 0 0\n");
    std::vector<std::string> common = {"--mount-table", table, "--cache", cache, "--name", "*.c"};
    auto with = [&](std::vector<std::string> more) {
        std::vector<std::string> args = common;
        args.insert(args.end(), more.begin(), more.end());
        return runTool(dir, args);
    };
    ToolRun all = with({tree});
    ASSERT_EQ(0, all.status) << all.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "mnt/inner.c"}), all.lineSet());
    ToolRun noTmpfs = with({"--exclude-fs", "tmpfs", tree});
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), noTmpfs.lineSet());
    ToolRun onlyTmpfs = with({"--include-fs", "tmpfs", tree});
    EXPECT_EQ(paths({"mnt/inner.c"}), onlyTmpfs.lineSet());
    ToolRun direct = with({"--no-cache", "--exclude-fs", "tmpfs", tree});
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), direct.lineSet());
}

// ------------------------------------------------------------ formats

// A flat JSON object of strings, numbers and booleans, as the tool writes it.
bool parseJsonObject(const std::string& line, std::map<std::string, std::string>& out) {
    size_t i = 0;
    auto skip = [&] {
        while (i < line.size() && line[i] == ' ') ++i;
    };
    auto parseString = [&](std::string& s) -> bool {
        if (i >= line.size() || line[i] != '"') return false;
        ++i;
        while (i < line.size() && line[i] != '"') {
            if (line[i] == '\\') {
                ++i;
                if (i >= line.size()) return false;
                char c = line[i];
                if (c == 'n') s.push_back('\n');
                else if (c == 't') s.push_back('\t');
                else if (c == 'r') s.push_back('\r');
                else if (c == 'u') {
                    if (i + 4 >= line.size()) return false;
                    s.push_back(static_cast<char>(std::stoi(line.substr(i + 1, 4), nullptr, 16)));
                    i += 4;
                } else s.push_back(c);
            } else {
                s.push_back(line[i]);
            }
            ++i;
        }
        if (i >= line.size()) return false;
        ++i;
        return true;
    };
    skip();
    if (i >= line.size() || line[i] != '{') return false;
    ++i;
    while (true) {
        skip();
        std::string key, value;
        if (!parseString(key)) return false;
        skip();
        if (i >= line.size() || line[i] != ':') return false;
        ++i;
        skip();
        if (i < line.size() && line[i] == '"') {
            if (!parseString(value)) return false;
            value = "s:" + value;
        } else {
            size_t end = line.find_first_of(",}", i);
            if (end == std::string::npos) return false;
            value = line.substr(i, end - i);
            i = end;
        }
        out[key] = value;
        skip();
        if (i < line.size() && line[i] == ',') {
            ++i;
            continue;
        }
        if (i < line.size() && line[i] == '}') return i + 1 == line.size();
        return false;
    }
}

TEST_F(FsQueryTool, JsonFormatIsOneObjectPerLineWithTheFieldsOfTheAnswer) {
    ToolRun r = query({"--format", "json", "--name", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    std::vector<std::string> lines = r.lines();
    ASSERT_EQ(2u, lines.size());
    std::map<std::string, std::map<std::string, std::string>> byName;
    for (const std::string& line : lines) {
        std::map<std::string, std::string> object;
        ASSERT_TRUE(parseJsonObject(line, object)) << line;
        byName[object["name"]] = object;
    }
    ASSERT_EQ(1u, byName.count("s:x.c"));
    std::map<std::string, std::string>& x = byName["s:x.c"];
    for (const char* key : {"path", "name", "fullPath", "md5", "sha256", "attr", "size", "crc32", "q32"}) {
        EXPECT_EQ(1u, x.count(key)) << key;
    }
    EXPECT_EQ(9u, x.size());
    EXPECT_EQ("s:" + path("a/"), x["path"]);
    EXPECT_EQ("s:" + path("a/x.c"), x["fullPath"]);
    EXPECT_EQ("3", x["size"]);
    // No checksum was asked for.
    EXPECT_EQ("null", x["md5"]);
    EXPECT_EQ("null", x["sha256"]);
    EXPECT_EQ("null", x["crc32"]);
    EXPECT_EQ("null", x["q32"]);
    unsigned long attr = std::stoul(x["attr"]);
    EXPECT_EQ(0x2000u, attr & 0x3001u);  // a regular file, not a directory or link
    EXPECT_EQ(0x2u, attr & 0x2u);        // the owner may read it
    EXPECT_EQ("6", byName["s:y.c"]["size"]);

    // The status fields come with --stat, read from the file.
    ToolRun stat = query({"--format", "json", "--stat", "--name", "x.c", tree});
    ASSERT_EQ(0, stat.status) << stat.err;
    std::map<std::string, std::string> s;
    ASSERT_TRUE(parseJsonObject(stat.lines().at(0), s)) << stat.out;
    EXPECT_EQ(17u, s.size());
    struct stat st;
    ASSERT_EQ(0, lstat(path("a/x.c").c_str(), &st));
    EXPECT_EQ(std::to_string(static_cast<unsigned int>(st.st_ino)), s["iNode"]);
    EXPECT_EQ(std::to_string(static_cast<long>(st.st_mtime)), s["lastModifyTime"]);
    EXPECT_EQ(std::to_string(st.st_uid), s["userId"]);
    EXPECT_EQ("1", s["linkCount"]);
    EXPECT_EQ("3", s["size"]);
}

TEST_F(FsQueryTool, JsonEscapesQuotesAndBackslashesInNames) {
    dir.write("tree/odd \"q\" \\ name.c", "x\n");
    ToolRun r = query({"--format", "json", "--name", "odd*", tree});
    ASSERT_EQ(0, r.status) << r.err;
    ASSERT_EQ(1u, r.lines().size());
    EXPECT_TRUE(contains(r.out, "\"name\":\"odd \\\"q\\\" \\\\ name.c\""));
    std::map<std::string, std::string> object;
    ASSERT_TRUE(parseJsonObject(r.lines()[0], object));
    EXPECT_EQ("s:odd \"q\" \\ name.c", object["name"]);
}

TEST_F(FsQueryTool, CsvFormatHasAHeaderRowAndQuotedFields) {
    dir.write("tree/a,b.c", "comma\n");
    ToolRun r = query({"--format", "csv", "--name", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    std::vector<std::string> lines = r.lines();
    ASSERT_EQ(4u, lines.size());
    EXPECT_EQ("path,name,fullPath,md5,sha256,attr,size,crc32,q32", lines[0]);
    bool sawComma = false;
    for (size_t i = 1; i < lines.size(); ++i) {
        if (contains(lines[i], "\"a,b.c\"")) {
            sawComma = true;
            // No checksum was asked for: the fields are empty.
            EXPECT_EQ(0u, lines[i].find(path("") + ",\"a,b.c\",\"" + path("a,b.c") + "\",,,")) << lines[i];
        } else {
            EXPECT_EQ(8, std::count(lines[i].begin(), lines[i].end(), ','));
        }
    }
    EXPECT_TRUE(sawComma);
    ToolRun stat = query({"--format", "csv", "--stat", "--name", "x.c", tree});
    std::vector<std::string> statLines = stat.lines();
    ASSERT_EQ(2u, statLines.size()) << stat.err;
    EXPECT_EQ(
        "path,name,fullPath,md5,sha256,attr,size,device,groupId,userId,iNode,lastAccessTime,createTime,"
        "lastModifyTime,linkCount,crc32,q32",
        statLines[0]);
    EXPECT_EQ(16, std::count(statLines[1].begin(), statLines[1].end(), ','));
}

TEST_F(FsQueryTool, NullFormatPrintsNothingAndStillCountsHits) {
    ToolRun r = query({"--format", "null", "--stats", tree});
    ASSERT_EQ(0, r.status);
    EXPECT_EQ("", r.out);
    EXPECT_TRUE(contains(r.err, "fsquery: hits: 6\n"));
}

// ------------------------------------------------------------ sorting

TEST_F(FsQueryTool, SortByNameAscendingAndDescending) {
    ToolRun up = query({"--sort", "name", "--name", "*.*", tree});
    ASSERT_EQ(0, up.status) << up.err;
    std::vector<std::string> expected = {path("a/b/Upper.C"), path("c/big.bin"), path("top.h"),
                                         path("a/x.c"),       path("a/b/y.c"),   path("c/z.txt")};
    EXPECT_EQ(expected, up.lines());
    ToolRun down = query({"--sort", "name", "--reverse", "--stats", "--name", "*.*", tree});
    std::reverse(expected.begin(), expected.end());
    EXPECT_EQ(expected, down.lines());
    EXPECT_TRUE(contains(down.err, "fsquery: hits: 6\n")) << down.err;
}

TEST_F(FsQueryTool, SortBySizeAndByFullPath) {
    ToolRun size = query({"--sort", "size", "--reverse", "--name", "*.*", tree});
    ASSERT_EQ(0, size.status) << size.err;
    std::vector<std::string> lines = size.lines();
    ASSERT_EQ(6u, lines.size());
    EXPECT_EQ(path("c/big.bin"), lines[0]);
    EXPECT_EQ(path("a/b/Upper.C"), lines[1]);
    EXPECT_EQ(path("a/b/y.c"), lines[2]);
    ToolRun full = query({"--sort", "fullpath", tree});
    std::vector<std::string> expected = {path("a/b/Upper.C"), path("a/b/y.c"), path("a/x.c"),
                                         path("c/big.bin"),   path("c/z.txt"), path("top.h")};
    EXPECT_EQ(expected, full.lines());
    // The directory text alone: "a/" sorts before "a/b/".
    ToolRun byPath = query({"--sort", "path", "--name", "*.c", tree});
    EXPECT_EQ((std::vector<std::string>{path("a/x.c"), path("a/b/y.c")}), byPath.lines());
}

TEST_F(FsQueryTool, SortedJsonKeepsTheRecordFields) {
    ToolRun r = query({"--sort", "size", "--format", "json", "--name", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    ASSERT_EQ(2u, r.lines().size());
    std::map<std::string, std::string> first, second;
    ASSERT_TRUE(parseJsonObject(r.lines()[0], first));
    ASSERT_TRUE(parseJsonObject(r.lines()[1], second));
    EXPECT_EQ("s:x.c", first["name"]);
    EXPECT_EQ("3", first["size"]);
    EXPECT_EQ("6", second["size"]);
}

TEST_F(FsQueryTool, SortFileLivesInTheCacheDirectoryAndIsRemoved) {
    ToolRun r = query({"--sort", "name", tree});
    ASSERT_EQ(0, r.status) << r.err;
    std::string listing = testsupport::runCommand("ls -A '" + cache + "/all'");
    EXPECT_FALSE(contains(listing, "sort-")) << listing;
    EXPECT_FALSE(contains(listing, "fsq_")) << listing;
    ToolRun direct = query({"--no-cache", "--sort", "size", "--name", "*.c", tree});
    EXPECT_EQ((std::vector<std::string>{path("a/x.c"), path("a/b/y.c")}), direct.lines());
    EXPECT_EQ("all\n", testsupport::runCommand("ls -A '" + cache + "'"));
}

// ---------------------------------------------------------- checksums

TEST_F(FsQueryTool, ChecksumsFromTheCacheAndFromTheDirectWalk) {
    const std::string md5OfHi = "764efa883dda1e11db47671c4a3bbd9e";  // "hi\n"
    const std::string crcOfHi = "ed6f7a7a";
    ToolRun cached = query({"--md5", "--crc32", "--name", "x.c", tree});
    ASSERT_EQ(0, cached.status) << cached.err;
    EXPECT_EQ(md5OfHi + "  " + crcOfHi + "  " + path("a/x.c") + "\n", cached.out);
    EXPECT_TRUE(testsupport::fileExists(cache + "/all+sums/files.dat"));
    ToolRun again = query({"--md5", "--crc32", "--name", "x.c", tree});
    EXPECT_EQ(cached.out, again.out);
    ToolRun direct = query({"--no-cache", "--md5", "--crc32", "--name", "x.c", tree});
    EXPECT_EQ(cached.out, direct.out);
    // Q32 comes out the same from the cache and from the walk.
    ToolRun q32Cached = query({"--q32", "--name", "x.c", tree});
    ToolRun q32Direct = query({"--no-cache", "--q32", "--name", "x.c", tree});
    ASSERT_EQ(0, q32Cached.status) << q32Cached.err;
    EXPECT_EQ(q32Cached.out, q32Direct.out);
    ASSERT_EQ(8u + 2u + path("a/x.c").size() + 1u, q32Cached.out.size()) << q32Cached.out;
    EXPECT_NE("00000000", q32Cached.out.substr(0, 8));
    ToolRun json = query({"--md5", "--format", "json", "--name", "x.c", tree});
    std::map<std::string, std::string> object;
    ASSERT_TRUE(parseJsonObject(json.lines().at(0), object));
    EXPECT_EQ("s:" + md5OfHi, object["md5"]);
}

TEST_F(FsQueryTool, KnownMd5KeepsOnlyFilesWithThatSum) {
    const std::string md5OfHello = "b1946ac92492d2347c6235b4d2611184";  // "hello\n"
    ToolRun cached = query({"--known-md5", md5OfHello, tree});
    ASSERT_EQ(0, cached.status) << cached.err;
    EXPECT_EQ(paths({"a/b/y.c"}), cached.lineSet());
    ToolRun direct = query({"--no-cache", "--known-md5", md5OfHello, tree});
    EXPECT_EQ(paths({"a/b/y.c"}), direct.lineSet());
    ToolRun none = query({"--known-md5", "00000000000000000000000000000000", tree});
    EXPECT_EQ("", none.out);
}

// ------------------------------------------------------ cache handling

TEST_F(FsQueryTool, NoCacheWalksDirectlyAndKeepsNothing) {
    ToolRun r = query({"--no-cache", "--stats", "--name", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), r.lineSet());
    EXPECT_TRUE(contains(r.err, "fsquery: mode: direct walk, no cache\n"));
    EXPECT_TRUE(contains(r.err, "fsquery: roots: 1 walked directly\n"));
    EXPECT_TRUE(contains(r.err, "fsquery: scanned: 6 files\n")) << r.err;
    EXPECT_FALSE(testsupport::fileExists(cache));
    ToolRun excluded = query({"--no-cache", "--exclude", path("a"), tree});
    EXPECT_EQ(paths({"top.h", "c/z.txt", "c/big.bin"}), excluded.lineSet());
    ToolRun flat = query({"--no-cache", "--non-recursive", path("a")});
    EXPECT_EQ(paths({"a/x.c"}), flat.lineSet());
}

TEST_F(FsQueryTool, CacheFilesSelectsTheSelectiveCache) {
    ToolRun r = query({"--stats", "--cache-files", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c"}), r.lineSet());
    EXPECT_TRUE(contains(r.err, "fsquery: mode: cache (FS_Cache2) in ")) << r.err;
    std::string listing = testsupport::runCommand("ls '" + cache + "'");
    EXPECT_EQ(0u, listing.find("sel-")) << listing;
    ToolRun second = query({"--stats", "--cache-files", "*.c", tree});
    EXPECT_TRUE(contains(second.err, "1 served from the cache, 0 rebuilt"));
    EXPECT_EQ(r.lineSet(), second.lineSet());
    // The full cache is another one and knows every file.
    ToolRun everything = query({tree});
    EXPECT_EQ(6u, everything.lines().size());
}

TEST_F(FsQueryTool, CacheDirectoryIsCreatedWhenMissing) {
    std::string nested = dir.file("deep/er/cache");
    ToolRun r = runTool(dir, {"--mount-table", mtab, "--cache", nested, "--name", "x.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c"}), r.lineSet());
    EXPECT_TRUE(testsupport::fileExists(nested + "/all/files.dat"));
}

TEST_F(FsQueryTool, DefaultCacheIsUnderXdgCacheHomeElseHome) {
    ToolRun r = runTool(dir, {"--mount-table", mtab, "--name", "x.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_TRUE(testsupport::fileExists(dir.file("xdg/fsquery/all/files.dat")));
    ToolRun home = runTool(dir, {"--mount-table", mtab, "--name", "x.c", tree}, {"XDG_CACHE_HOME="});
    ASSERT_EQ(0, home.status) << home.err;
    EXPECT_TRUE(testsupport::fileExists(dir.file("home/.cache/fsquery/all/files.dat")));
}

TEST_F(FsQueryTool, NothingIsWrittenOutsideTheCacheDirectory) {
    std::string work = dir.mkdirs("work");
    ToolRun r = runTool(dir, base({"--sort", "name", "--stats", tree}), {"TMPDIR=" + work}, work);
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ("", testsupport::runCommand("ls -A '" + work + "'"));
    EXPECT_EQ("", testsupport::runCommand("ls -A '" + dir.file("tree/empty") + "'"));
    EXPECT_FALSE(testsupport::fileExists(dir.file("xdg")));
    EXPECT_FALSE(testsupport::fileExists(dir.file("home")));
    // The engine's list of scanned folders is kept in the cache.
    EXPECT_EQ(0u, testsupport::readFile(cache + "/all/traceKEL_scanned_dirs.log")
                      .find("LIST OF SCANNED DIRECTORIES DURING SOFTWARE SCAN:\n"));
    // Lock files went to the cache directory and were removed with their locks.
    std::string listing = testsupport::runCommand("ls -A '" + cache + "/all'");
    EXPECT_FALSE(contains(listing, "_mutex")) << listing;
}

TEST_F(FsQueryTool, LockHeldByAnotherProcessIsReportedClearly) {
    ASSERT_EQ(0, query({"--name", "x.c", tree}).status);
    // The lock file of the cache: its real path with "/" made "_", plus
    // "_c_mutex", in the cache directory.  This process takes the lock; the
    // tool is another process.
    char* real = realpath((cache + "/all").c_str(), nullptr);
    ASSERT_NE(nullptr, real);
    std::string name = real;
    std::free(real);
    std::string mangled = name;
    std::replace(mangled.begin(), mangled.end(), '/', '_');
    std::string lockFile = name + "/" + mangled + "_c_mutex";
    int fd = open(lockFile.c_str(), O_RDWR | O_CREAT, 0600);
    ASSERT_GE(fd, 0);
    ASSERT_EQ(0, lockf(fd, F_LOCK, 0));
    ToolRun r = query({"--lock-wait", "300", "--name", "x.c", tree});
    EXPECT_EQ(7, r.status);
    EXPECT_EQ("fsquery: the cache " + name + " is locked by another process (waited 300 ms; see --lock-wait)\n",
              r.err);
    EXPECT_EQ("", r.out);
    ASSERT_EQ(0, lockf(fd, F_ULOCK, 0));
    ToolRun after = query({"--lock-wait", "300", "--name", "x.c", tree});
    EXPECT_EQ(0, after.status) << after.err;
    EXPECT_EQ(paths({"a/x.c"}), after.lineSet());
    close(fd);
    unlink(lockFile.c_str());
}

TEST_F(FsQueryTool, BuildTimeoutDiscardsTheCacheAndTheNextRunRebuilds) {
    ToolRun r = query({"--timeout", "0", tree});
    EXPECT_EQ(5, r.status);
    EXPECT_EQ("fsquery: build timed out (-42); the cache is discarded and rebuilt by the next run\n", r.err);
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/files.dat"));
    ToolRun next = query({"--stats", tree});
    ASSERT_EQ(0, next.status) << next.err;
    EXPECT_TRUE(contains(next.err, "0 served from the cache, 1 rebuilt"));
    EXPECT_EQ(6u, next.lines().size());
}

TEST_F(FsQueryTool, ScanTimeoutsMapToTheirOwnExitCode) {
    ASSERT_EQ(0, query({tree}).status);
    // Served from the cache, the extraction has no time left.
    ToolRun cached = query({"--timeout", "0", tree});
    EXPECT_EQ(4, cached.status);
    EXPECT_EQ("fsquery: scan timed out (-41)\n", cached.err);
    // A timeout of the extraction leaves the cache intact.
    ToolRun after = query({"--stats", tree});
    EXPECT_TRUE(contains(after.err, "1 served from the cache, 0 rebuilt"));
    ToolRun direct = query({"--no-cache", "--timeout", "0", tree});
    EXPECT_EQ(4, direct.status);
    EXPECT_EQ("fsquery: scan timed out (-41)\n", direct.err);
}

TEST_F(FsQueryTool, LeftOverUpdateFlagOfACrashedRunIsRecoveredFrom) {
    ASSERT_EQ(0, query({tree}).status);
    dir.write("cache/all/directories.cuflag", "");
    dir.write("tree/c/late.c", "late\n");
    ToolRun r = query({"--stats", "--name", "*.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_TRUE(contains(r.err, "0 served from the cache, 1 rebuilt")) << r.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/late.c"}), r.lineSet());
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/directories.cuflag"));
}

TEST_F(FsQueryTool, ClosedOutputPipeEndsQuietlyAndClosesTheCache) {
    for (int i = 0; i < 3000; ++i) dir.write("tree/many/file" + std::to_string(i) + ".dat", "");
    std::string script = dir.write("pipe.sh", testsupport::emulatorPrefix() + "'" + kTool + "' --mount-table '" + mtab + "' --cache '" +
                                                  cache + "' '" + tree +
                                                  "' | head -n 1 >/dev/null\necho \"status=${PIPESTATUS[0]}\"\n");
    std::string out = testsupport::runCommand("bash '" + script + "'");
    EXPECT_TRUE(contains(out, "status=0")) << out;
    EXPECT_FALSE(testsupport::fileExists(cache + "/all/directories.cuflag"));
    ToolRun again = query({"--stats", "--format", "null", tree});
    EXPECT_TRUE(contains(again.err, "1 served from the cache, 0 rebuilt")) << again.err;
    EXPECT_TRUE(contains(again.err, "fsquery: hits: 3006\n")) << again.err;
}

// ---------------------------------------------------- trace, config, cpu

TEST_F(FsQueryTool, TraceFileReceivesTheEnginesMilestones) {
    std::string trace = dir.file("trace.log");
    ToolRun r = query({"--trace", trace, "--trace-level", "1", "--name", "x.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    std::string text = testsupport::readFile(trace);
    EXPECT_TRUE(contains(text, "IMPORTANT: File system access on '" + tree + "'")) << text;
    EXPECT_FALSE(contains(text, "PATH INCLUDED"));  // a level 3 message
    ToolRun bad = query({"--trace", dir.file("no/such/dir/trace.log"), tree});
    EXPECT_EQ(1, bad.status);
    EXPECT_TRUE(contains(bad.err, "cannot open trace file"));
}

TEST_F(FsQueryTool, ConfigurationFileIsRead) {
    std::string config = dir.write("fsquery.conf", "# settings\nfscanner.home=" + dir.path() + "\n");
    ToolRun r = query({"--config", config, "--name", "x.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c"}), r.lineSet());
    ToolRun missing = query({"--config", dir.file("missing.conf"), tree});
    EXPECT_EQ(2, missing.status);
    EXPECT_TRUE(contains(missing.err, "cannot read configuration file"));
}

TEST_F(FsQueryTool, CpuThrottleIsHandedToTheEngine) {
    std::string trace = dir.file("cpu.log");
    ToolRun r = query({"--cpu", "30:70", "--trace", trace, "--trace-level", "1", "--name", "x.c", tree});
    ASSERT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c"}), r.lineSet());
    EXPECT_TRUE(contains(testsupport::readFile(trace), "CpuThreshold is set to: 30.0% (0:0:30:70)."))
        << testsupport::readFile(trace);
}

// A cache build of 2000 files held to a tiny share of the CPU: it runs for
// several seconds, long enough for the progress display to start.
std::vector<std::string> slowBuild(testsupport::TempDir& dir, const std::string& mtab, const std::string& cache) {
    for (int i = 0; i < 2000; ++i) dir.write("slow/f" + std::to_string(i), "");
    return {"--mount-table", mtab, "--cache", cache, "--cpu", "1:200", "--name", "f1", dir.file("slow")};
}

TEST_F(FsQueryTool, NoProgressOffATerminal) {
    time_t start = time(nullptr);
    ToolRun r = runTool(dir, slowBuild(dir, mtab, cache));
    ASSERT_EQ(0, r.status);
    EXPECT_GE(time(nullptr) - start, 2);
    EXPECT_EQ("", r.err);
    EXPECT_EQ(dir.file("slow/f1") + "\n", r.out);
}

TEST_F(FsQueryTool, ProgressShowsOnATerminalForALongScan) {
    std::vector<std::string> args = slowBuild(dir, mtab, cache);
    int master = posix_openpt(O_RDWR | O_NOCTTY);
    ASSERT_GE(master, 0);
    ASSERT_EQ(0, grantpt(master));
    ASSERT_EQ(0, unlockpt(master));
    std::string slave = ptsname(master);
    std::string outName = dir.file("tty.out");
    pid_t pid = fork();
    if (pid == 0) {
        int tty = open(slave.c_str(), O_RDWR);
        int out = open(outName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
        dup2(out, 1);
        dup2(tty, 2);
        close(master);
        setenv("HOME", dir.file("home").c_str(), 1);
        std::vector<std::string> argv{kTool};
        argv.insert(argv.end(), args.begin(), args.end());
        testsupport::execBuildProgram(argv);
        _exit(98);
    }
    std::string terminal;
    int status = 0;
    bool exited = false;
    while (true) {
        pollfd p = {master, POLLIN, 0};
        if (poll(&p, 1, 100) > 0) {
            char buffer[512];
            ssize_t n = read(master, buffer, sizeof buffer);
            if (n > 0) {
                terminal.append(buffer, static_cast<size_t>(n));
                continue;
            }
        }
        if (exited) break;
        if (waitpid(pid, &status, WNOHANG) == pid) exited = true;
    }
    close(master);
    ASSERT_TRUE(WIFEXITED(status));
    EXPECT_EQ(0, WEXITSTATUS(status));
    EXPECT_TRUE(contains(terminal, "\rfsquery: ")) << terminal;
    EXPECT_TRUE(contains(terminal, " entries scanned, ")) << terminal;
    // The line is wiped before the tool ends.
    EXPECT_TRUE(contains(terminal, "\r\033[K")) << terminal;
    EXPECT_EQ(dir.file("slow/f1") + "\n", testsupport::readFile(outName));
}

}  // namespace
