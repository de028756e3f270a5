// The sort of a result file against sort(1) on the same hits.
//
//   resultsort_bench TREE [ROUNDS [WORKDIR]]
//
// Takes every entry below TREE that is not a directory (as fsquery lists
// them: path, name, size), writes them once as a result file and once as text
// lines, and then, ROUNDS times (default 7) for each key, sorts the result
// file in place with FsResultSetReader_OnFile::sort and the lines with
// sort(1), alternating which of the two goes first.  Keys: size (the lines
// are "size<TAB>path/name", sorted by `sort -s -t TAB -k1,1n`) and full path
// (the lines are "path/name", sorted by `sort`).  sort(1) runs with LC_ALL=C,
// so that both order bytes, and writes its output to a file of WORKDIR, as
// the library writes its sorted file.  Each round starts from a fresh copy of
// the unsorted result file.  The library sorts in a child process of its own
// each time (fsquery sorts once per run, with cold memory and caches), and
// only its sort call is timed; sort(1)'s time is its whole run.
//
// Prints the median of each, the ratio library / sort(1) (below 1 means the
// library is faster), and the load average before and after.  The library's
// output is checked once per key: every record present and in order.  Exit
// status 1 when a check fails.  WORKDIR defaults to a new directory under
// /tmp; the files there are removed at the end.
#include <fcntl.h>
#include <ftw.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset_file.h"

namespace {

struct Hit {
    std::string path;
    std::string name;
    unsigned long long size;
};

std::vector<Hit>* g_hits = nullptr;

int collect(const char* fullPath, const struct stat* st, int type, struct FTW* where) {
    if (type == FTW_D || type == FTW_DP || type == FTW_DNR) return 0;
    std::string full = fullPath;
    Hit hit;
    hit.path = full.substr(0, static_cast<size_t>(where->base) - 1);
    if (hit.path.empty()) hit.path = "/";
    hit.name = full.substr(static_cast<size_t>(where->base));
    hit.size = static_cast<unsigned long long>(st->st_size);
    g_hits->push_back(hit);
    return 0;
}

std::wstring widen(const std::string& text) {
    std::wstring out;
    out.reserve(text.size());
    for (unsigned char c : text) out += static_cast<wchar_t>(c);
    return out;
}

std::string join(const Hit& hit) {
    return hit.path == "/" ? "/" + hit.name : hit.path + "/" + hit.name;
}

bool copyFile(const std::string& from, const std::string& to) {
    std::ifstream in(from, std::ios::binary);
    std::ofstream out(to, std::ios::binary | std::ios::trunc);
    out << in.rdbuf();
    return static_cast<bool>(out);
}

double seconds(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// One run of sort(1) with LC_ALL=C; its wall time, or a negative number when
// it failed.
double timeSortCommand(const std::vector<std::string>& args) {
    std::vector<char*> argv;
    for (const std::string& a : args) argv.push_back(const_cast<char*>(a.c_str()));
    argv.push_back(nullptr);
    auto start = std::chrono::steady_clock::now();
    pid_t pid = fork();
    if (pid == 0) {
        setenv("LC_ALL", "C", 1);
        execvp(argv[0], argv.data());
        _exit(127);
    }
    int status = 0;
    if (pid < 0 || waitpid(pid, &status, 0) != pid) return -1;
    double elapsed = seconds(start);
    return WIFEXITED(status) && WEXITSTATUS(status) == 0 ? elapsed : -1;
}

// One library sort of a fresh copy of the result file, in a child process
// of its own, as fsquery sorts once per run: its memory, caches and mappings
// start cold like those of sort(1).  Only the sort call is timed, inside the
// child.  Checks the order when asked.  Negative when the sort or the check
// failed.
double sortInChild(const std::string& work, unsigned int key, size_t expected, bool check) {
    FsResultSetReader_OnFile reader(work.c_str());
    auto start = std::chrono::steady_clock::now();
    int sorted = reader.sort(key, 1, true);
    double elapsed = seconds(start);
    if (sorted != 1) return -1;
    if (check) {
        reader.moveFirst();
        FsFileInfo previous;
        FsFileInfo current;
        size_t count = 0;
        while (reader.getNext(current) == 1) {
            if (count > 0 && previous.compare(current, static_cast<int>(key), 3, true)) {
                std::fprintf(stderr, "resultsort_bench: record %zu is out of order\n", count);
                return -1;
            }
            previous = current;
            ++count;
        }
        if (count != expected) {
            std::fprintf(stderr, "resultsort_bench: %zu records after the sort, %zu before\n", count, expected);
            return -1;
        }
    }
    return elapsed;
}

double timeLibrarySort(const std::string& pristine, const std::string& work, unsigned int key,
                       size_t expected, bool check) {
    if (!copyFile(pristine, work)) return -1;
    int channel[2];
    if (pipe(channel) != 0) return -1;
    pid_t pid = fork();
    if (pid == 0) {
        close(channel[0]);
        double elapsed = sortInChild(work, key, expected, check);
        ssize_t written = write(channel[1], &elapsed, sizeof elapsed);
        _exit(written == static_cast<ssize_t>(sizeof elapsed) ? 0 : 1);
    }
    close(channel[1]);
    double elapsed = -1;
    if (pid < 0 || read(channel[0], &elapsed, sizeof elapsed) != static_cast<ssize_t>(sizeof elapsed)) {
        elapsed = -1;
    }
    close(channel[0]);
    int status = 0;
    if (pid > 0) waitpid(pid, &status, 0);
    return elapsed;
}

double median(std::vector<double> values) {
    std::sort(values.begin(), values.end());
    size_t n = values.size();
    return n % 2 == 1 ? values[n / 2] : (values[n / 2 - 1] + values[n / 2]) / 2;
}

std::string loadAverage() {
    std::ifstream in("/proc/loadavg");
    std::string a, b, c;
    in >> a >> b >> c;
    return a + " " + b + " " + c;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc < 2 || argc > 4) {
        std::fprintf(stderr, "usage: %s TREE [ROUNDS [WORKDIR]]\n", argv[0]);
        return 2;
    }
    std::string tree = argv[1];
    int rounds = argc > 2 ? std::atoi(argv[2]) : 7;
    if (rounds < 1) rounds = 1;
    std::string work;
    bool ownWork = argc <= 3;
    if (ownWork) {
        char pattern[] = "/tmp/resultsort-bench-XXXXXX";
        if (mkdtemp(pattern) == nullptr) {
            std::perror("resultsort_bench: mkdtemp");
            return 1;
        }
        work = pattern;
    } else {
        work = argv[3];
    }

    std::vector<Hit> hits;
    g_hits = &hits;
    if (nftw(tree.c_str(), collect, 64, FTW_PHYS) != 0 || hits.empty()) {
        std::fprintf(stderr, "resultsort_bench: no entries below %s\n", tree.c_str());
        return 1;
    }

    std::string pristine = work + "/hits.result";
    std::string workFile = work + "/sorted.result";
    std::string fullLines = work + "/hits-fullpath.txt";
    std::string sizeLines = work + "/hits-size.txt";
    std::string sortOutput = work + "/sorted.txt";
    {
        FsResultSetWriter_OnFile writer(pristine.c_str());
        for (const Hit& hit : hits) {
            std::wstring path = widen(hit.path);
            std::wstring name = widen(hit.name);
            if (writer.addRecord(path.c_str(), name.c_str(), hit.size, 0, L"0", 0, 0) != 0) {
                std::fprintf(stderr, "resultsort_bench: cannot write %s\n", pristine.c_str());
                return 1;
            }
        }
        writer.close();
    }
    {
        std::ofstream full(fullLines, std::ios::trunc);
        std::ofstream bySize(sizeLines, std::ios::trunc);
        for (const Hit& hit : hits) {
            full << join(hit) << '\n';
            bySize << hit.size << '\t' << join(hit) << '\n';
        }
    }

    struct Key {
        const char* label;
        unsigned int number;
        std::vector<std::string> command;
    };
    std::vector<Key> keys = {
        {"size", 4, {"sort", "-s", "-t", "\t", "-k1,1n", "-o", sortOutput, sizeLines}},
        {"fullpath", 3, {"sort", "-o", sortOutput, fullLines}},
    };

    std::string loadBefore = loadAverage();
    std::printf("resultsort_bench: %zu hits below %s, %d alternating rounds per key\n", hits.size(),
                tree.c_str(), rounds);
    std::printf("load average before: %s\n\n", loadBefore.c_str());
    std::printf("| Key | Library sort, median (s) | sort(1), median (s) | Ratio library / sort(1) |\n");
    std::printf("|---|---:|---:|---:|\n");
    bool ok = true;
    for (const Key& key : keys) {
        std::vector<double> library;
        std::vector<double> command;
        for (int round = 0; round < rounds && ok; ++round) {
            for (int turn = 0; turn < 2; ++turn) {
                bool libraryTurn = (round % 2 == 0) == (turn == 0);
                double t = libraryTurn ? timeLibrarySort(pristine, workFile, key.number, hits.size(), round == 0)
                                       : timeSortCommand(key.command);
                if (t < 0) {
                    std::fprintf(stderr, "resultsort_bench: %s sort by %s failed\n",
                                 libraryTurn ? "the library's" : "sort(1)'s", key.label);
                    ok = false;
                    break;
                }
                (libraryTurn ? library : command).push_back(t);
            }
        }
        if (!ok) break;
        double l = median(library);
        double c = median(command);
        std::printf("| %s | %.3f | %.3f | %.2f |\n", key.label, l, c, c > 0 ? l / c : 0.0);
    }
    std::printf("\nload average after: %s\n", loadAverage().c_str());

    for (const std::string& f : {pristine, workFile, fullLines, sizeLines, sortOutput}) unlink(f.c_str());
    if (ownWork) rmdir(work.c_str());
    return ok ? 0 : 1;
}
