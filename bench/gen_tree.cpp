// Helper of the fsquery benchmark and of `make run`.
//
//   gen_tree DIR [ENTRIES [SEED]]
//       Makes a synthetic tree of about ENTRIES entries (files and directories,
//       default 200000) under DIR, which must not exist yet.  Directories are
//       filled breadth first with 4 to 40 files and 0 to 7 subdirectories
//       each, so the depth grows with the size as in a real tree (8 levels
//       for 200,000 entries).  Names mix common extensions; file sizes are
//       0 to 64 KiB and set with ftruncate, so the tree takes little disk.
//       Exactly one file is called "needle.conf", in one of the deepest
//       directories, for exact-name queries.  The same SEED gives the same tree.
//
//   gen_tree --measure -- COMMAND [ARGS...]
//       Runs COMMAND with standard output on /dev/null and prints one line:
//       "<wall seconds> <peak resident KiB> <exit status>".
#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <string>
#include <vector>

namespace {

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

const char* const kStems[] = {"main", "util", "config", "index", "test", "data", "image", "report",
                              "module", "core", "helper", "readme", "notes", "build", "cache", "parser",
                              "server", "client", "widget", "schema", "thumb", "backup", "Makefile", "log"};
const char* const kExtensions[] = {".c", ".h", ".cpp", ".hpp", ".py", ".txt", ".md", ".json",
                                   ".xml", ".png", ".jpg", ".so", ".o", ".log", ".gz", ".html",
                                   ".js", ".conf", "", ".sh"};
const char* const kDirectoryStems[] = {"src", "lib", "include", "doc", "share", "bin", "tests", "assets",
                                       "pkg", "modules", "data", "tmp", "vendor", "res", "conf", "img"};

int fail(const char* what, const std::string& path) {
    std::fprintf(stderr, "gen_tree: %s %s: %s\n", what, path.c_str(), std::strerror(errno));
    return 1;
}

int generate(const std::string& root, long entries, uint64_t seed) {
    if (mkdir(root.c_str(), 0755) != 0) return fail("cannot create", root);
    Random random(seed);
    struct Level {
        std::string path;
        int depth;
    };
    std::deque<Level> pending;
    pending.push_back({root, 0});
    long made = 0;
    long files = 0;
    long directories = 0;
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
            std::snprintf(name, sizeof name, "%s_%ld%s", stem, files, extension);
            std::string path = level.path + "/" + name;
            int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
            if (fd < 0) return fail("cannot create", path);
            off_t size = random.below(4) == 0 ? 0 : static_cast<off_t>(random.below(65536));
            if (size > 0 && ftruncate(fd, size) != 0) return fail("cannot size", path);
            close(fd);
            ++made;
            ++files;
        }
        unsigned int subdirectories = random.below(8);
        // Keep the walk going while the tree is young, however the dice fall.
        if (pending.empty() && subdirectories == 0) subdirectories = 2;
        for (unsigned int i = 0; i < subdirectories && made < entries; ++i) {
            char name[64];
            std::snprintf(name, sizeof name, "%s%ld",
                          kDirectoryStems[random.below(sizeof kDirectoryStems / sizeof kDirectoryStems[0])],
                          directories);
            std::string path = level.path + "/" + name;
            if (mkdir(path.c_str(), 0755) != 0) return fail("cannot create", path);
            pending.push_back({path, level.depth + 1});
            ++made;
            ++directories;
        }
    }
    std::string needle = deepest + "/needle.conf";
    int fd = open(needle.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0644);
    if (fd < 0) return fail("cannot create", needle);
    close(fd);
    std::printf("gen_tree: %ld files, %ld directories, depth %d, needle at %s\n", files + 1, directories,
                deepestDepth, needle.c_str());
    return 0;
}

int measure(char** command) {
    timespec start, end;
    clock_gettime(CLOCK_MONOTONIC, &start);
    pid_t pid = fork();
    if (pid < 0) return fail("cannot fork for", command[0]);
    if (pid == 0) {
        int null = open("/dev/null", O_WRONLY);
        if (null >= 0) dup2(null, 1);
        execvp(command[0], command);
        std::fprintf(stderr, "gen_tree: cannot run %s: %s\n", command[0], std::strerror(errno));
        _exit(127);
    }
    int status = 0;
    rusage usage;
    std::memset(&usage, 0, sizeof usage);
    if (wait4(pid, &status, 0, &usage) != pid) return fail("cannot wait for", command[0]);
    clock_gettime(CLOCK_MONOTONIC, &end);
    double seconds = static_cast<double>(end.tv_sec - start.tv_sec) +
                     static_cast<double>(end.tv_nsec - start.tv_nsec) / 1e9;
    int code = WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
    std::printf("%.4f %ld %d\n", seconds, usage.ru_maxrss, code);
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc >= 4 && std::strcmp(argv[1], "--measure") == 0 && std::strcmp(argv[2], "--") == 0) {
        return measure(argv + 3);
    }
    if (argc < 2 || argc > 4 || argv[1][0] == '-') {
        std::fprintf(stderr, "usage: gen_tree DIR [ENTRIES [SEED]]\n       gen_tree --measure -- COMMAND [ARGS...]\n");
        return 2;
    }
    long entries = argc >= 3 ? std::strtol(argv[2], nullptr, 10) : 200000;
    uint64_t seed = argc >= 4 ? std::strtoull(argv[3], nullptr, 10) : 1;
    if (entries < 1) {
        std::fprintf(stderr, "gen_tree: ENTRIES must be a positive number\n");
        return 2;
    }
    return generate(argv[1], entries, seed);
}
