// Sorts a result file of one million records (by default) and reports the
// time of each phase and the peak memory of the process.
//
//   sort_bench [records] [key 1..4] [order 1|2] [directory]
//
// Records carry unique random paths, names and sizes.  With a directory the
// temporary file goes there (as fsq_<n>); otherwise it goes where the result
// set puts it by itself.  The program checks that the records come back in
// order and complete, and exits with 1 if they do not.
#include <sys/resource.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <random>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset_file.h"

namespace {

double secondsSince(std::chrono::steady_clock::time_point start) {
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

long peakKilobytes() {
    struct rusage usage;
    if (::getrusage(RUSAGE_SELF, &usage) != 0) return -1;
    return usage.ru_maxrss;
}

char* noTempName(char*) {
    return nullptr;
}

}  // namespace

int main(int argc, char** argv) {
    unsigned long count = argc > 1 ? std::strtoul(argv[1], nullptr, 10) : 1000000UL;
    unsigned int key = argc > 2 ? static_cast<unsigned int>(std::strtoul(argv[2], nullptr, 10)) : 3;
    unsigned int order = argc > 3 ? static_cast<unsigned int>(std::strtoul(argv[3], nullptr, 10)) : 1;
    std::string prefix;
    if (argc > 4) {
        prefix = std::string(argv[4]) + "/";
        FsResultSet_OnFile::setTempNameSources(noTempName, prefix.c_str(), prefix.c_str());
    }
    if (key < 1 || key > 4 || (order != 1 && order != 2) || count == 0) {
        std::fprintf(stderr, "usage: %s [records] [key 1..4] [order 1|2] [directory]\n", argv[0]);
        return 2;
    }

    std::mt19937 random(20261122);
    std::vector<unsigned int> paths(count), names(count), sizes(count);
    for (unsigned long i = 0; i < count; ++i) paths[i] = names[i] = sizes[i] = static_cast<unsigned int>(i);
    std::shuffle(paths.begin(), paths.end(), random);
    std::shuffle(names.begin(), names.end(), random);
    std::shuffle(sizes.begin(), sizes.end(), random);
    long baseline = peakKilobytes();

    FsResultSet_OnFile* set = new FsResultSet_OnFile();
    std::string fileName = set->getFileName();
    FsResultSetWriter* writer = set->getWriter();

    auto start = std::chrono::steady_clock::now();
    FsFileInfo info;
    for (unsigned long i = 0; i < count; ++i) {
        std::wstring path = L"/bench/dir" + std::to_wstring(paths[i]);
        std::wstring name = L"file" + std::to_wstring(names[i]) + L".dat";
        info.setFilePath(path.c_str());
        info.setFileName(name.c_str());
        info.setFileSize(static_cast<unsigned long long>(sizes[i]) * 13 + 1);
        info.setCRC32(static_cast<unsigned int>(i));
        if (writer->addRecord(info) != 0) {
            std::fprintf(stderr, "addRecord failed at record %lu\n", i);
            return 1;
        }
    }
    FsResultSetReader* reader = set->getReader();
    double writeSeconds = secondsSince(start);

    start = std::chrono::steady_clock::now();
    int sorted = reader->sort(key, order, true);
    double sortSeconds = secondsSince(start);

    start = std::chrono::steady_clock::now();
    reader->moveFirst();
    FsFileInfo previous;
    FsFileInfo current;
    unsigned long read = 0;
    bool inOrder = true;
    std::vector<bool> seen(count, false);
    unsigned int backwards = order == 1 ? 3u : 4u;  // previous > current, previous < current
    while (reader->getNext(current) == 1) {
        if (read > 0 && previous.compare(current, static_cast<int>(key), backwards, true)) inOrder = false;
        unsigned int id = current.getCRC32();
        if (id < count) seen[id] = true;
        previous = current;
        ++read;
    }
    double readSeconds = secondsSince(start);
    bool complete = read == count && std::find(seen.begin(), seen.end(), false) == seen.end();

    delete set;
    delete reader;

    std::printf("file             %s\n", fileName.c_str());
    std::printf("records          %lu (key %u, order %u)\n", count, key, order);
    std::printf("write            %.2f s\n", writeSeconds);
    std::printf("sort             %.2f s (result %d)\n", sortSeconds, sorted);
    std::printf("read and check   %.2f s\n", readSeconds);
    std::printf("peak memory      %ld KiB (%ld KiB before the set)\n", peakKilobytes(), baseline);
    std::printf("order            %s, %s\n", inOrder ? "sorted" : "NOT SORTED",
                complete ? "complete" : "RECORDS MISSING");
    return inOrder && complete ? 0 : 1;
}
