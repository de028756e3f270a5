// Helper of the fsquery benchmark and of `make run`.
//
//   gen_tree DIR [ENTRIES [SEED]]
//       Makes a synthetic tree of about ENTRIES entries (files and directories,
//       default 200000) under DIR, which must not exist yet; the shape is
//       described in tree_generator.h.  Exactly one file is called
//       "needle.conf", for exact-name queries.  The same ENTRIES and SEED give
//       the same tree, whatever the umask.
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

#include "tree_generator.h"

namespace {

int fail(const char* what, const std::string& path) {
    std::fprintf(stderr, "gen_tree: %s %s: %s\n", what, path.c_str(), std::strerror(errno));
    return 1;
}

int generate(const std::string& root, long long entries, uint64_t seed) {
    benchtree::TreeSummary summary;
    if (!benchtree::generate(root, entries, seed, summary)) {
        std::fprintf(stderr, "gen_tree: %s\n", summary.error.c_str());
        return 1;
    }
    std::printf("gen_tree: %lld files, %lld directories, depth %d, needle at %s\n",
                static_cast<long long>(summary.files), static_cast<long long>(summary.directories),
                summary.depth, summary.needle.c_str());
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
    long long entries = argc >= 3 ? std::strtoll(argv[2], nullptr, 10) : 200000;
    uint64_t seed = argc >= 4 ? std::strtoull(argv[3], nullptr, 10) : 1;
    if (entries < 1) {
        std::fprintf(stderr, "gen_tree: ENTRIES must be a positive number\n");
        return 2;
    }
    return generate(argv[1], entries, seed);
}
