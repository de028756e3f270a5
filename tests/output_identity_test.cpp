// The tool's answer, byte for byte.  Over one generated tree of about 20,000
// entries (the benchmark's generator, so the same shape of tree that speed
// work is measured on), each query runs three ways: the first run, which
// builds a fresh cache; a second run served from that cache; and a direct
// walk with --no-cache.  The CSV lines of the three runs, sorted, must equal
// each other and a digest recorded here from a known-good build.  Work that
// makes the walk, the tables, the indexes or the extraction faster must leave
// every one of these bytes alone.
//
// What the CSV holds that belongs to the moment or the machine is kept out:
// the tree's own location is replaced by "TREE" before comparing, and --stat
// (owner, inode, times) is never asked for.  Names, sizes and modes of the
// tree are fixed by the generator whatever the umask; the mount table is a
// fixture that makes "/" one local file system.
//
// When a digest no longer matches, the failure message gives the new count
// and digest.  A new digest is right only when the output was meant to
// change; otherwise the change under test altered an answer.
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "../bench/tree_generator.h"
#include "support/testsupport.h"
#include "support/toolrun.h"

namespace {

using testsupport::TempDir;
using testsupport::ToolRun;
using testsupport::runTool;

const int64_t kEntries = 20000;
const uint64_t kSeed = 1;

// FNV-1a over 64 bits: small enough to keep in the test, and any change of a
// byte or of the line order moves it.
uint64_t fnv1a(const std::string& text) {
    uint64_t hash = 0xcbf29ce484222325ull;
    for (unsigned char c : text) {
        hash ^= c;
        hash *= 0x100000001b3ull;
    }
    return hash;
}

std::string hex64(uint64_t value) {
    char buffer[17];
    std::snprintf(buffer, sizeof buffer, "%016llx", static_cast<unsigned long long>(value));
    return buffer;
}

bool contains(const std::string& text, const std::string& part) { return text.find(part) != std::string::npos; }

// The sorted lines of one run with the tree's location replaced by "TREE".
struct Listing {
    std::vector<std::string> lines;

    size_t count() const { return lines.size(); }
    std::string joined() const {
        std::string all;
        for (const std::string& line : lines) all += line + "\n";
        return all;
    }
    std::string digest() const { return hex64(fnv1a(joined())); }
    bool has(const std::string& line) const { return std::binary_search(lines.begin(), lines.end(), line); }
};

std::string replaceAll(std::string text, const std::string& from, const std::string& to) {
    for (size_t at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size()))
        text.replace(at, from.size(), to);
    return text;
}

class OutputIdentity : public ::testing::Test {
protected:
    static void SetUpTestSuite() {
        dir = new TempDir();
        tree = dir->file("tree");
        benchtree::TreeSummary summary;
        generated = benchtree::generate(tree, kEntries, kSeed, summary);
        generateError = summary.error;
        needle = summary.needle;
        generatedFiles = summary.files;
        generatedDirectories = summary.directories;
        if (!generated) return;
        // Entries the generator never makes but the output has to get right:
        // a name that CSV must quote, a symbolic link (listed, never followed
        // or read), a pipe (listed, never opened) and an empty directory.
        // Their modes are set explicitly, away from the umask.
        std::string odd = dir->mkdirs("tree/odd");
        std::string quoted = dir->write("tree/odd/we,ird \"name\".txt", "hi\n");
        chmod(quoted.c_str(), 0640);
        symlinked = symlink("we,ird \"name\".txt", (odd + "/link").c_str()) == 0;
        piped = mkfifo((odd + "/pipe").c_str(), 0600) == 0 && chmod((odd + "/pipe").c_str(), 0604) == 0;
        chmod(dir->mkdirs("tree/odd/empty").c_str(), 0750);
        chmod(odd.c_str(), 0755);
        mtab = dir->write("mtab", "/dev/vda / ext4 rw 0 0\n");
    }

    static void TearDownTestSuite() {
        delete dir;
        dir = nullptr;
    }

    void SetUp() override {
        ASSERT_TRUE(generated) << generateError;
        ASSERT_TRUE(symlinked);
        ASSERT_TRUE(piped);
    }

    static Listing listing(const ToolRun& run) {
        Listing result;
        for (const std::string& line : run.lines()) result.lines.push_back(replaceAll(line, tree, "TREE"));
        std::sort(result.lines.begin(), result.lines.end());
        return result;
    }

    static ToolRun tool(const std::vector<std::string>& mode, const std::vector<std::string>& query) {
        std::vector<std::string> args = {"--mount-table", mtab, "--format", "csv", "--stats"};
        args.insert(args.end(), mode.begin(), mode.end());
        args.insert(args.end(), query.begin(), query.end());
        args.push_back(tree);
        return runTool(*dir, args);
    }

    // Runs the query the three ways and checks that they agree with each
    // other and with the recorded line count and digest; gives the listing.
    static Listing expectIdentical(const std::vector<std::string>& query, size_t expectedLines,
                                   const std::string& expectedDigest) {
        std::string label;
        for (const std::string& word : query) label += " " + word;
        std::string cache = dir->file("cache" + std::to_string(++caches));

        ToolRun first = tool({"--cache", cache}, query);
        EXPECT_EQ(0, first.status) << label << "\n" << first.err;
        EXPECT_TRUE(contains(first.err, "roots: 0 served from the cache, 1 rebuilt")) << label << "\n" << first.err;

        ToolRun served = tool({"--cache", cache}, query);
        EXPECT_EQ(0, served.status) << label << "\n" << served.err;
        EXPECT_TRUE(contains(served.err, "roots: 1 served from the cache, 0 rebuilt")) << label << "\n" << served.err;

        ToolRun direct = tool({"--no-cache"}, query);
        EXPECT_EQ(0, direct.status) << label << "\n" << direct.err;
        EXPECT_TRUE(contains(direct.err, "mode: direct walk, no cache")) << label << "\n" << direct.err;

        Listing firstLines = listing(first);
        Listing servedLines = listing(served);
        Listing directLines = listing(direct);
        EXPECT_TRUE(firstLines.lines == servedLines.lines) << label << ": the served run differs from the first";
        EXPECT_TRUE(firstLines.lines == directLines.lines) << label << ": the direct walk differs from the first run";
        EXPECT_EQ(expectedLines, firstLines.count()) << label;
        EXPECT_EQ(expectedDigest, firstLines.digest())
            << label << ": now " << firstLines.count() << " lines, digest " << firstLines.digest();
        return firstLines;
    }

    static TempDir* dir;
    static std::string tree;
    static std::string mtab;
    static std::string needle;
    static int64_t generatedFiles;
    static int64_t generatedDirectories;
    static bool generated;
    static std::string generateError;
    static bool symlinked;
    static bool piped;
    static int caches;
};

TempDir* OutputIdentity::dir = nullptr;
std::string OutputIdentity::tree;
std::string OutputIdentity::mtab;
std::string OutputIdentity::needle;
int64_t OutputIdentity::generatedFiles = 0;
int64_t OutputIdentity::generatedDirectories = 0;
bool OutputIdentity::generated = false;
std::string OutputIdentity::generateError;
bool OutputIdentity::symlinked = false;
bool OutputIdentity::piped = false;
int OutputIdentity::caches = 0;

const char kHeader[] = "path,name,fullPath,md5,sha256,attr,size,crc32,q32";

TEST_F(OutputIdentity, GeneratorMakesTheRecordedTree) {
    // The generator itself is pinned first: a changed tree would make every
    // digest below fail for a reason that has nothing to do with the tool.
    EXPECT_EQ(17263, generatedFiles);
    EXPECT_EQ(2738, generatedDirectories);
    EXPECT_EQ(tree + "/tests3/share13/tmp27/vendor60/include207/assets774/needle.conf", needle);
}

TEST_F(OutputIdentity, EveryEntryWithItsChecksumsIsTheSameThreeWays) {
    Listing all = expectIdentical({"--md5", "--crc32", "--q32"}, 17267, "54d0603c9e527db8");
    EXPECT_TRUE(all.has(kHeader));
    EXPECT_TRUE(all.has("TREE/odd/,\"we,ird \"\"name\"\".txt\",\"TREE/odd/we,ird \"\"name\"\".txt\","
                        "764efa883dda1e11db47671c4a3bbd9e,,8214,3,3983506042,3983506042"));
    EXPECT_TRUE(all.has("TREE/odd/,link,TREE/odd/link,,,5118,17,,"));
    EXPECT_TRUE(all.has("TREE/odd/,pipe,TREE/odd/pipe,,,134,0,,"));
    // An empty file: the sums of no bytes.
    EXPECT_TRUE(all.has("TREE/tests3/share13/tmp27/vendor60/include207/assets774/,needle.conf,"
                        "TREE/tests3/share13/tmp27/vendor60/include207/assets774/needle.conf,"
                        "d41d8cd98f00b204e9800998ecf8427e,,8342,0,0,0"));
}

TEST_F(OutputIdentity, EveryEntryWithoutChecksumsIsTheSameThreeWays) {
    Listing all = expectIdentical({}, 17267, "120712455f91099b");
    EXPECT_TRUE(all.has("TREE/odd/,link,TREE/odd/link,,,5118,17,,"));
}

TEST_F(OutputIdentity, WildcardIsTheSameThreeWays) { expectIdentical({"--name", "*.c"}, 886, "5eec52d63c862f70"); }

TEST_F(OutputIdentity, ExactNameIsTheSameThreeWays) {
    Listing hit = expectIdentical({"--name", "needle.conf"}, 2, "26e1bfbeb0288e06");
    EXPECT_TRUE(hit.has(kHeader));
}

TEST_F(OutputIdentity, CaseBlindMaskIsTheSameThreeWays) {
    expectIdentical({"--ignore-case", "--name", "MAKEFILE_1*", "--name", "*.JSON"}, 1186, "dfd4c974c99096e2");
}

TEST_F(OutputIdentity, ExpressionOverSizeAndNameIsTheSameThreeWays) {
    expectIdentical({"-e", "[SIZE]>=60000 && [FILENAME]==\"*.h\""}, 61, "27ceb46978ebe029");
}

TEST_F(OutputIdentity, ExcludedSubtreeIsTheSameThreeWays) {
    // The needle's top directory and all below it are left out.
    Listing rest = expectIdentical({"--exclude", tree + "/tests3", "--name", "*.conf"}, 585, "a138794300afd7aa");
    EXPECT_FALSE(contains(rest.joined(), "needle.conf"));
}

TEST_F(OutputIdentity, TopLevelOnlyIsTheSameThreeWays) {
    expectIdentical({"--non-recursive"}, 33, "aba7a106887e1ff2");
}

}  // namespace
