// The fsquery tool's conventions as a command-line program: NUL-separated
// output, rebuilding on request and ages that mean what they say, a direct
// walk that needs no cache directory, machine formats that print what the
// answer holds, checksum output that md5sum -c can read, messages that say a
// thing once and name what is wrong, and a help text (with man page and
// completion) that lists every option.
//
// Each case has a fixture tree, a mount table ("/" the one local drive) and a
// cache directory of its own in a temporary directory.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <regex>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {

const std::string kSource = FSCANNER_TEST_SOURCE_DIR;

using testsupport::ToolRun;
using testsupport::runTool;

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

// A flat JSON object of strings, numbers, booleans and nulls: "s:" before a
// string's value, the bare text of anything else.
bool parseJsonObject(const std::string& line, std::map<std::string, std::string>& out) {
    size_t i = 0;
    auto parseString = [&](std::string& s) -> bool {
        if (i >= line.size() || line[i] != '"') return false;
        for (++i; i < line.size() && line[i] != '"'; ++i) {
            if (line[i] == '\\') ++i;
            if (i < line.size()) s.push_back(line[i]);
        }
        if (i >= line.size()) return false;
        ++i;
        return true;
    };
    if (line.empty() || line[0] != '{') return false;
    ++i;
    while (true) {
        std::string key, value;
        if (!parseString(key) || i >= line.size() || line[i] != ':') return false;
        ++i;
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
        if (i < line.size() && line[i] == ',') {
            ++i;
            continue;
        }
        return i + 1 == line.size() && line[i] == '}';
    }
}

const char kMd5OfHi[] = "764efa883dda1e11db47671c4a3bbd9e";  // "hi\n"

class FsQueryConventions : public ::testing::Test {
protected:
    void SetUp() override {
        tree = dir.mkdirs("tree");
        dir.write("tree/a/x.c", "hi\n");
        dir.write("tree/a/b/y.c", "hello\n");
        dir.write("tree/c/z.txt", "z\n");
        mtab = dir.write("mtab", "/dev/vda / ext4 rw 0 0\n");
        cache = dir.file("cache");
    }

    std::vector<std::string> base(std::vector<std::string> more) const {
        std::vector<std::string> args = {"--mount-table", mtab, "--cache", cache};
        args.insert(args.end(), more.begin(), more.end());
        return args;
    }
    ToolRun query(std::vector<std::string> more) const { return runTool(dir, base(more)); }
    ToolRun direct(std::vector<std::string> more) const {
        more.insert(more.begin(), "--no-cache");
        return runTool(dir, base(more));
    }

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

std::vector<std::string> splitAtNul(const std::string& text) {
    std::vector<std::string> parts;
    size_t start = 0;
    for (size_t i = 0; i < text.size(); ++i) {
        if (text[i] == '\0') {
            parts.push_back(text.substr(start, i - start));
            start = i + 1;
        }
    }
    if (start != text.size()) parts.push_back("<unterminated>" + text.substr(start));
    std::sort(parts.begin(), parts.end());
    return parts;
}

TEST_F(FsQueryConventions, Print0EndsEachPathWithANul) {
    std::vector<std::string> expected = {path("a/b/y.c"), path("a/x.c"), path("c/z.txt")};
    for (const char* option : {"-0", "--print0"}) {
        ToolRun cached = query({option, tree});
        ASSERT_EQ(0, cached.status) << cached.err;
        EXPECT_EQ(std::string::npos, cached.out.find('\n'));
        EXPECT_EQ(expected, splitAtNul(cached.out));
        ToolRun walked = direct({option, tree});
        EXPECT_EQ(expected, splitAtNul(walked.out));
    }
    ToolRun sums = query({"-0", "--md5", "--name", "x.c", tree});
    EXPECT_EQ(std::string(kMd5OfHi) + "  " + path("a/x.c") + std::string(1, '\0'), sums.out);
    ToolRun json = query({"-0", "--format", "json", tree});
    EXPECT_EQ(2, json.status);
    EXPECT_EQ("fsquery: option '-0' needs '--format text' (see fsquery --help)\n", json.err);
}

TEST_F(FsQueryConventions, RefreshRebuildsTheTreesOfTheQueryNow) {
    ASSERT_EQ(0, query({tree}).status);
    dir.write("tree/c/new.c", "new\n");
    ToolRun served = query({"--stats", tree});
    EXPECT_TRUE(contains(served.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n")) << served.err;
    EXPECT_EQ(0u, served.lineSet().count(path("c/new.c")));
    // In the same second as the build: rebuilt all the same.
    ToolRun refreshed = query({"--refresh", "--stats", tree});
    ASSERT_EQ(0, refreshed.status) << refreshed.err;
    EXPECT_TRUE(contains(refreshed.err, "fsquery: roots: 0 served from the cache, 1 rebuilt\n")) << refreshed.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/z.txt", "c/new.c"}), refreshed.lineSet());
    // --max-age 0 means the same.
    dir.write("tree/c/newer.c", "newer\n");
    ToolRun zero = query({"--max-age", "0", "--stats", tree});
    EXPECT_TRUE(contains(zero.err, "fsquery: roots: 0 served from the cache, 1 rebuilt\n")) << zero.err;
    EXPECT_EQ(1u, zero.lineSet().count(path("c/newer.c")));
    ToolRun again = query({"--stats", tree});
    EXPECT_TRUE(contains(again.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n")) << again.err;
}

TEST_F(FsQueryConventions, AgeReachingBackBefore1970KeepsTheTree) {
    ASSERT_EQ(0, query({tree}).status);
    dir.write("tree/c/new.c", "new\n");
    for (const char* age : {"4000000000", "4294967295"}) {
        ToolRun r = query({"--max-age", age, "--stats", tree});
        ASSERT_EQ(0, r.status) << r.err;
        EXPECT_TRUE(contains(r.err, "fsquery: roots: 1 served from the cache, 0 rebuilt\n")) << age << r.err;
        EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/z.txt"}), r.lineSet());
    }
    ToolRun help = runTool(dir, {"--help"});
    EXPECT_TRUE(contains(help.out, "0 rebuilds every time, an age reaching back before\n")) << help.out;
}

TEST_F(FsQueryConventions, NoCacheNeedsNoCacheDirectory) {
    const std::vector<std::string> noHome = {"HOME", "XDG_CACHE_HOME"};
    ToolRun r = runTool(dir, {"--mount-table", mtab, "--no-cache", tree}, noHome);
    EXPECT_EQ(0, r.status) << r.err;
    EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/z.txt"}), r.lineSet());
    EXPECT_EQ("", r.err);
    // A sort file goes to $TMPDIR then, and is removed.
    std::string tmp = dir.mkdirs("tmp");
    std::vector<std::string> env = noHome;
    env.push_back("TMPDIR=" + tmp);
    ToolRun sorted = runTool(dir, {"--mount-table", mtab, "--no-cache", "--sort", "name", tree}, env);
    EXPECT_EQ(0, sorted.status) << sorted.err;
    EXPECT_EQ((std::vector<std::string>{path("a/x.c"), path("a/b/y.c"), path("c/z.txt")}), sorted.lines());
    EXPECT_EQ("", testsupport::runCommand("ls -A '" + tmp + "'"));
    // The cache itself still needs its directory.
    ToolRun cached = runTool(dir, {"--mount-table", mtab, tree}, noHome);
    EXPECT_EQ(1, cached.status);
    EXPECT_EQ("fsquery: no cache directory: set XDG_CACHE_HOME or HOME, or give --cache\n", cached.err);
}

TEST_F(FsQueryConventions, JsonAndCsvPrintWhatTheAnswerHolds) {
    ASSERT_EQ(0, query({tree}).status);
    // The file grows after the cache was built; the cache still answers.
    dir.write("tree/a/x.c", "hi and more\n");
    ToolRun json = query({"--format", "json", "--name", "x.c", tree});
    ASSERT_EQ(0, json.status) << json.err;
    std::map<std::string, std::string> answer;
    ASSERT_TRUE(parseJsonObject(json.lines().at(0), answer)) << json.out;
    EXPECT_EQ("3", answer["size"]);  // as the cache holds it
    EXPECT_EQ(0u, answer.count("iNode"));
    EXPECT_EQ(0u, answer.count("lastModifyTime"));
    EXPECT_EQ(0u, answer.count("validMask"));
    EXPECT_EQ("null", answer["md5"]);
    EXPECT_EQ("null", answer["crc32"]);

    // With --stat every field comes from the file now, the size too.
    ToolRun stat = query({"--format", "json", "--stat", "--name", "x.c", tree});
    std::map<std::string, std::string> now;
    ASSERT_TRUE(parseJsonObject(stat.lines().at(0), now)) << stat.out;
    struct stat st;
    ASSERT_EQ(0, lstat(path("a/x.c").c_str(), &st));
    EXPECT_EQ("12", now["size"]);
    EXPECT_EQ(std::to_string(static_cast<unsigned int>(st.st_ino)), now["iNode"]);
    EXPECT_EQ(std::to_string(static_cast<long>(st.st_mtime)), now["lastModifyTime"]);

    ToolRun csv = query({"--format", "csv", "--name", "x.c", tree});
    ASSERT_EQ(2u, csv.lines().size()) << csv.out;
    EXPECT_EQ("path,name,fullPath,md5,sha256,attr,size,crc32,q32", csv.lines()[0]);
    EXPECT_TRUE(std::regex_match(csv.lines()[1], std::regex(path("a/") + ",x\\.c," + path("a/x.c") + ",,,[0-9]+,3,,")))
        << csv.out;

    // A file gone since the cache was built: the answer's fields stay, the
    // status fields are null.
    ASSERT_EQ(0, unlink(path("a/b/y.c").c_str()));
    ToolRun vanished = query({"--format", "json", "--stat", "--name", "y.c", tree});
    std::map<std::string, std::string> missing;
    ASSERT_TRUE(parseJsonObject(vanished.lines().at(0), missing)) << vanished.out;
    EXPECT_EQ("null", missing["iNode"]);
    EXPECT_EQ("6", missing["size"]);
}

TEST_F(FsQueryConventions, AbsentChecksumsAreNullInJsonAndEmptyInCsv) {
    ASSERT_EQ(0, symlink("x.c", path("a/x-link.c").c_str()));
    for (bool noCache : {false, true}) {
        std::vector<std::string> args = {"--format", "json", "--md5", "--name", "x*", tree};
        ToolRun r = noCache ? direct(args) : query(args);
        ASSERT_EQ(0, r.status) << r.err;
        std::map<std::string, std::map<std::string, std::string>> byName;
        for (const std::string& line : r.lines()) {
            std::map<std::string, std::string> object;
            ASSERT_TRUE(parseJsonObject(line, object)) << line;
            byName[object["name"]] = object;
        }
        ASSERT_EQ(2u, byName.size()) << r.out;
        EXPECT_EQ(std::string("s:") + kMd5OfHi, byName["s:x.c"]["md5"]);
        EXPECT_EQ("null", byName["s:x-link.c"]["md5"]);
        EXPECT_EQ("null", byName["s:x.c"]["sha256"]);
        EXPECT_EQ("null", byName["s:x.c"]["crc32"]);
        std::vector<std::string> csvArgs = {"--format", "csv", "--crc32", "--name", "x-link.c", tree};
        ToolRun csv = noCache ? direct(csvArgs) : query(csvArgs);
        ASSERT_EQ(2u, csv.lines().size()) << csv.out;
        std::string row = csv.lines()[1];
        EXPECT_EQ(",,", row.substr(row.size() - 2)) << row;
        EXPECT_TRUE(contains(row, path("a/x-link.c") + ",,,")) << row;
    }
}

TEST_F(FsQueryConventions, Md5OutputHasALineOnlyForRegularFiles) {
    ASSERT_EQ(0, symlink("x.c", path("a/x-link.c").c_str()));
    ASSERT_EQ(0, mkfifo(path("c/pipe").c_str(), 0600));
    std::regex sumLine("[0-9a-f]{32}  /.*");
    for (bool noCache : {false, true}) {
        ToolRun r = noCache ? direct({"--md5", tree}) : query({"--md5", tree});
        ASSERT_EQ(0, r.status) << r.err;
        EXPECT_EQ(paths({"a/x.c", "a/b/y.c", "c/z.txt"}).size(), r.lines().size()) << r.out;
        for (const std::string& line : r.lines()) EXPECT_TRUE(std::regex_match(line, sumLine)) << line;
        EXPECT_FALSE(contains(r.out, "x-link.c")) << r.out;
        EXPECT_FALSE(contains(r.out, "pipe")) << r.out;
        // md5sum reads every line and finds every file intact (not asked
        // when a line names the pipe, which it would wait on for ever).
        if (contains(r.out, "pipe")) continue;
        std::string list = dir.write("sums.md5", r.out);
        int status = -1;
        std::string check = testsupport::runCommand("md5sum -c --strict --quiet '" + list + "' 2>&1", &status);
        EXPECT_EQ(0, status) << check;
    }
}

TEST_F(FsQueryConventions, MissingConfigurationFileIsReportedOnce) {
    std::string missing = dir.file("missing.conf");
    ToolRun r = query({"--config", missing, tree});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: cannot read configuration file '" + missing + "': No such file or directory\n", r.err);
}

TEST_F(FsQueryConventions, StatsNeverShowNegativeCounts) {
    // A cache that cannot be opened: a directory stands where a table goes.
    dir.mkdirs("cache/all/files.dat");
    ToolRun r = query({"--stats", tree});
    EXPECT_EQ(8, r.status);
    EXPECT_TRUE(contains(r.err, "fsquery: scanned: 0 files, 0 directories\n")) << r.err;
    EXPECT_FALSE(std::regex_search(r.err, std::regex("-[0-9]+ (files|directories)"))) << r.err;
    ToolRun walked = direct({"--stats", tree});
    EXPECT_FALSE(std::regex_search(walked.err, std::regex(": -[0-9]"))) << walked.err;
}

// The last file row's slot points one byte past where its record begins:
// the damage shows when that row is read, after the others.
void pointLastFileRowPastItsStart(const std::string& cache) {
    std::string pointers = cache + "/all/files.pxx";
    std::string slots = testsupport::readFile(pointers);
    ASSERT_GE(slots.size(), 8u);
    size_t last = slots.size() / 4;
    uint32_t offset = 0;
    while (last > 1) {
        --last;
        std::memcpy(&offset, slots.data() + last * 4, 4);
        if (offset != 0) break;
    }
    ASSERT_NE(0u, offset);
    offset += 1;
    std::memcpy(&slots[last * 4], &offset, 4);
    std::ofstream(pointers, std::ios::binary | std::ios::trunc) << slots;
}

TEST_F(FsQueryConventions, NothingIsPrintedBeforeTheCacheTurnsOutUnusable) {
    for (int i = 0; i < 40; ++i) dir.write("tree/many/f" + std::to_string(i), std::to_string(i));
    ASSERT_EQ(0, query({tree}).status);
    ASSERT_NO_FATAL_FAILURE(pointLastFileRowPastItsStart(cache));
    ToolRun r = query({tree});
    EXPECT_EQ(3, r.status) << r.err;
    EXPECT_EQ("", r.out);
    EXPECT_TRUE(contains(r.err, "cache unusable (-40)")) << r.err;
    // The next run builds a new cache and answers in full.
    ToolRun next = query({tree});
    EXPECT_EQ(0, next.status) << next.err;
    EXPECT_EQ(43u, next.lines().size());
}

// The same with an answer of many output buffers, which wait in memory one
// after the other: none of them is printed, and a served answer gives every
// line once, in the order of a second served run.
TEST_F(FsQueryConventions, NothingOfALongAnswerIsPrintedBeforeTheCacheTurnsOutUnusable) {
    const std::string padding(80, 'p');
    for (int i = 0; i < 3000; ++i) dir.write("tree/many/" + padding + std::to_string(i), "");
    ToolRun built = query({tree});
    ASSERT_EQ(0, built.status) << built.err;
    ASSERT_GT(built.out.size(), 4u << 16) << "the answer must span several output buffers";
    ToolRun served = query({tree});
    ASSERT_EQ(0, served.status) << served.err;
    EXPECT_EQ(built.out, served.out);
    // The cache keeps the rows in the order the walk met them, the order in
    // which a walk without the cache prints them.
    EXPECT_EQ(direct({tree}).out, served.out);
    EXPECT_EQ(3003u, served.lines().size());
    EXPECT_EQ(3003u, served.lineSet().size());

    ASSERT_NO_FATAL_FAILURE(pointLastFileRowPastItsStart(cache));
    ToolRun r = query({tree});
    EXPECT_EQ(3, r.status) << r.err;
    EXPECT_EQ("", r.out);
    EXPECT_TRUE(contains(r.err, "cache unusable (-40)")) << r.err;
}

// An answer larger than the 8 MiB it may wait in memory goes on waiting in a
// file: printed whole and in order once the query succeeds, not at all when
// it fails.
TEST_F(FsQueryConventions, AnAnswerPastItsMemoryWaitsInAFileAndIsPrintedWhole) {
    // Lines of some 2,900 bytes: a few thousand files make the size.
    std::string deep = "tree";
    for (int level = 0; level < 14; ++level) deep += "/" + std::string(200, 'd') + std::to_string(level);
    dir.mkdirs(deep);
    const int files = 3200;
    for (int i = 0; i < files; ++i) {
        int fd = ::open(dir.file(deep + "/f" + std::to_string(i)).c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        ASSERT_GE(fd, 0);
        ::close(fd);
    }
    ToolRun built = query({tree});
    ASSERT_EQ(0, built.status) << built.err;
    ASSERT_GT(built.out.size(), static_cast<size_t>(8u << 20)) << "the answer must outgrow the memory it waits in";
    EXPECT_EQ(static_cast<size_t>(files) + 3, built.lines().size());  // and the fixture's three
    EXPECT_EQ(direct({tree}).out, built.out);
    ToolRun served = query({tree});
    ASSERT_EQ(0, served.status) << served.err;
    EXPECT_EQ(built.out, served.out);

    ASSERT_NO_FATAL_FAILURE(pointLastFileRowPastItsStart(cache));
    ToolRun r = query({tree});
    EXPECT_EQ(3, r.status) << r.err;
    EXPECT_EQ("", r.out);
}

TEST_F(FsQueryConventions, BadOperandOfAnExpressionIsNamed) {
    ToolRun r = query({"-e", "[SIZE]>abc", tree});
    EXPECT_EQ(2, r.status);
    EXPECT_EQ("fsquery: invalid expression '[SIZE]>abc' (variable specified not found!: 'abc' is not a column "
              "(FILENAME, ATTR, SIZE, PATHID, MD5, CRC32, Q32); a text is written in double quotes)\n",
              r.err);
    ToolRun field = direct({"-e", "[SHORTFILENAME]==\"x.c\"", tree});
    EXPECT_EQ(2, field.status);
    EXPECT_TRUE(contains(field.err, "'SHORTFILENAME' is not a column")) << field.err;
}

// Every option the program knows, long and short.
const std::vector<std::string> kOptions = {
    "-e", "--expression", "--name", "--ignore-case", "--exclude", "--non-recursive", "--include-fs",
    "--exclude-fs", "--known-md5", "--cache", "--no-cache", "--cache-files", "--max-age", "--refresh",
    "--timeout", "--lock-wait", "--cpu", "--md5", "--crc32", "--q32", "--provider", "--config", "--trace",
    "--trace-level", "--sort", "--reverse", "--format", "-0", "--print0", "--stat", "--stats", "-h", "--help",
    "--version", "--mount-table", "--automounter-master"};

TEST_F(FsQueryConventions, HelpTellsWhatIsListedAndShowsEveryOption) {
    ToolRun help = runTool(dir, {"-h"});
    ASSERT_EQ(0, help.status);
    std::string text = help.out;
    std::replace(text.begin(), text.end(), '\n', ' ');
    text = std::regex_replace(text, std::regex(" +"), " ");
    EXPECT_TRUE(contains(text, "Listed are files, symbolic links (never followed), devices, FIFOs and sockets; "
                               "directories are not."))
        << help.out;
    EXPECT_TRUE(contains(text, "masks know * (any run) and ? (one character) only")) << help.out;
    std::string manPage = testsupport::readFile(kSource + "/tools/fsquery.1");
    std::string completion = testsupport::readFile(kSource + "/tools/fsquery.bash-completion");
    ASSERT_FALSE(manPage.empty());
    ASSERT_FALSE(completion.empty());
    for (const std::string& option : kOptions) {
        std::regex word("(^|[\\s,])" + std::regex_replace(option, std::regex("-"), "\\-") + "([\\s,]|$)");
        EXPECT_TRUE(std::regex_search(help.out, word)) << "help lacks " << option;
        std::string escaped = std::regex_replace(option, std::regex("-"), "\\-");
        EXPECT_TRUE(contains(manPage, escaped)) << "man page lacks " << option;
        EXPECT_TRUE(std::regex_search(completion, std::regex("(^|[\\s'])" + option + "([\\s']|$)")))
            << "completion lacks " << option;
    }
    ToolRun longForm = runTool(dir, {"--help"});
    EXPECT_EQ(help.out, longForm.out);
}

}  // namespace
