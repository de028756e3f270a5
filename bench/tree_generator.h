// The synthetic tree of the benchmark, shared by gen_tree and by the
// output-identity test, so that both look at the same shape of tree.
//
// Directories are filled breadth first with 4 to 40 files and 0 to 7
// subdirectories each, so the depth grows with the size as in a real tree
// (8 levels for 200,000 entries).  Names mix common extensions; file sizes are
// 0 to 64 KiB and set with ftruncate, so the tree takes little disk.  Exactly
// one file is called "needle.conf", in one of the deepest directories, for
// exact-name queries.
//
// The same entry count and seed give the same tree, byte for byte in every
// name, size and permission, on every machine and for 32- and 64-bit builds:
// the dice are a fixed xorshift64* generator, counts are 64-bit, and the
// modes do not depend on the caller's umask.  Modification times are those
// of the moment and are the one thing that differs between two trees.
#ifndef FSCANNER_BENCH_TREE_GENERATOR_H
#define FSCANNER_BENCH_TREE_GENERATOR_H

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <deque>
#include <string>

namespace benchtree {

// A small deterministic generator (xorshift64*), so that trees are the same
// on every machine.
struct Random {
    uint64_t state;
    explicit Random(uint64_t seed) : state(seed * 0x9e3779b97f4a7c15ull + 1) {}
    uint64_t next() {
        state ^= state >> 12;
        state ^= state << 25;
        state ^= state >> 27;
        return state * 0x2545f4914f6cdd1dull;
    }
    unsigned int below(unsigned int n) { return static_cast<unsigned int>(next() % n); }
};

// What generate() made.  On failure, error names the call, the path and the
// system's reason, and the tree is left as far as it got.
struct TreeSummary {
    int64_t files = 0;        // the needle included
    int64_t directories = 0;  // below the root
    int depth = 0;            // of the needle's directory, the root being 0
    std::string needle;       // full path of needle.conf
    std::string error;
};

// Restores the process's umask when it goes out of scope.  The tree's modes
// are part of what the identity test compares, so they are fixed here rather
// than left to whatever umask the caller runs with.
class UmaskGuard {
public:
    explicit UmaskGuard(mode_t mask) : saved_(umask(mask)) {}
    ~UmaskGuard() { umask(saved_); }
    UmaskGuard(const UmaskGuard&) = delete;
    UmaskGuard& operator=(const UmaskGuard&) = delete;

private:
    mode_t saved_;
};

namespace detail {

inline const char* const kStems[] = {"main",   "util",   "config", "index",  "test",   "data",
                                     "image",  "report", "module", "core",   "helper", "readme",
                                     "notes",  "build",  "cache",  "parser", "server", "client",
                                     "widget", "schema", "thumb",  "backup", "Makefile", "log"};
inline const char* const kExtensions[] = {".c",   ".h",  ".cpp", ".hpp", ".py",  ".txt",  ".md",
                                          ".json", ".xml", ".png", ".jpg", ".so",  ".o",    ".log",
                                          ".gz",  ".html", ".js", ".conf", "",     ".sh"};
inline const char* const kDirectoryStems[] = {"src", "lib",     "include", "doc",  "share", "bin",
                                              "tests", "assets", "pkg",     "modules", "data", "tmp",
                                              "vendor", "res",   "conf",    "img"};

inline bool failed(TreeSummary& summary, const char* what, const std::string& path) {
    summary.error = std::string(what) + " " + path + ": " + std::strerror(errno);
    return false;
}

}  // namespace detail

// Makes a tree of about `entries` entries (files and directories) under root,
// which must not exist yet.  Returns false with summary.error set on failure.
inline bool generate(const std::string& root, int64_t entries, uint64_t seed, TreeSummary& summary) {
    using namespace detail;
    summary = TreeSummary();
    UmaskGuard umaskGuard(022);
    if (mkdir(root.c_str(), 0755) != 0) return failed(summary, "cannot create", root);
    Random random(seed);
    struct Level {
        std::string path;
        int depth;
    };
    std::deque<Level> pending;
    pending.push_back({root, 0});
    int64_t made = 0;
    int64_t files = 0;
    int64_t directories = 0;
    std::string deepest = root;
    int deepestDepth = 0;
    while (made < entries && !pending.empty()) {
        Level level = pending.front();
        pending.pop_front();
        if (level.depth > deepestDepth || (level.depth == deepestDepth && random.below(4) == 0)) {
            deepest = level.path;
            deepestDepth = level.depth;
        }
        unsigned int fileCount = 4 + random.below(37);
        for (unsigned int i = 0; i < fileCount && made < entries; ++i) {
            char name[96];
            const char* stem = kStems[random.below(sizeof kStems / sizeof kStems[0])];
            const char* extension = kExtensions[random.below(sizeof kExtensions / sizeof kExtensions[0])];
            std::snprintf(name, sizeof name, "%s_%lld%s", stem, static_cast<long long>(files), extension);
            std::string path = level.path + "/" + name;
            int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
            if (fd < 0) return failed(summary, "cannot create", path);
            off_t size = random.below(4) == 0 ? 0 : static_cast<off_t>(random.below(65536));
            if (size > 0 && ftruncate(fd, size) != 0) {
                bool result = failed(summary, "cannot size", path);
                close(fd);
                return result;
            }
            close(fd);
            ++made;
            ++files;
        }
        unsigned int subdirectories = random.below(8);
        // Keep the walk going while the tree is young, however the dice fall.
        if (pending.empty() && subdirectories == 0) subdirectories = 2;
        for (unsigned int i = 0; i < subdirectories && made < entries; ++i) {
            char name[64];
            std::snprintf(name, sizeof name, "%s%lld",
                          kDirectoryStems[random.below(sizeof kDirectoryStems / sizeof kDirectoryStems[0])],
                          static_cast<long long>(directories));
            std::string path = level.path + "/" + name;
            if (mkdir(path.c_str(), 0755) != 0) return failed(summary, "cannot create", path);
            pending.push_back({path, level.depth + 1});
            ++made;
            ++directories;
        }
    }
    std::string needle = deepest + "/needle.conf";
    int fd = open(needle.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
    if (fd < 0) return failed(summary, "cannot create", needle);
    close(fd);
    summary.files = files + 1;
    summary.directories = directories;
    summary.depth = deepestDepth;
    summary.needle = needle;
    return true;
}

}  // namespace benchtree

#endif
