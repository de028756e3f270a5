// A host of the library in one file: fills a query, runs it on a cache object
// and prints each hit as it arrives.
//
//   host CACHE_DIR TREE [EXPRESSION]
//
// prints "<full path> <size>" for every file below TREE that answers
// EXPRESSION (default: every file).  The first run walks TREE into the cache
// under CACHE_DIR; runs within the hour are answered from the cache.  Exit
// status: 0 done, 1 the cache could not be made, 2 the query failed.
#include <sys/stat.h>
#include <sys/types.h>

#include <cerrno>
#include <clocale>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <string>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/sync.h"

namespace {

// The library takes wide texts; the host's locale says how bytes map to them.
std::wstring widen(const char* text) {
    std::wstring out(std::mbstowcs(nullptr, text, 0) + 1, L'\0');
    std::mbstowcs(&out[0], text, out.size());
    out.resize(std::wcslen(out.c_str()));
    return out;
}

// Prints each hit as it arrives.  The cache hands over FsFileInfo records;
// a record's path ends with '/', so path and name join as they are.
class Printer : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int,
                  const wchar_t*, unsigned int, unsigned int) override {
        std::printf("%ls%ls %llu\n", path, name, size);
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        std::printf("%ls%ls %llu\n", info.getPath(), info.getName(), info.getSize());
        return 0;
    }
    int close() override { return 0; }
};

}  // namespace

int main(int argc, char** argv) {
    if (argc < 3 || argc > 4) {
        std::fprintf(stderr, "usage: %s CACHE_DIR TREE [EXPRESSION]\n", argv[0]);
        return 2;
    }
    std::setlocale(LC_ALL, "");

    // The cache directory is the host's to make: the library creates its
    // files in it, not the directory itself.
    if (mkdir(argv[1], 0700) != 0 && errno != EEXIST) {
        std::perror(argv[1]);
        return 1;
    }

    // Lock files go to the lock store, by default the working directory.
    LinuxSharedMutex::setStorePath(argv[1]);

    FsGlue glue;                       // no checksums, remote trees walked directly
    glue.knownHashes = nullptr;
    glue.checksumFlags = 0;
    glue.reserved = 0;
    glue.cacheRemoteDrives = false;
    std::wstring cacheDir = widen(argv[1]);
    FS_Cache cache(L"dirs", L"files", cacheDir.c_str(), false, true, &glue, L"myhost");
    if (cache.create(0, FS_CACHE_OPEN_ALWAYS) != 0) {
        std::fprintf(stderr, "%s: cannot make the cache\n", argv[1]);
        return 1;
    }

    FsQuery query;
    query.addIncludePath(widen(argv[2]).c_str(), true);  // recursive
    query.setQuery(widen(argc == 4 ? argv[3] : "[SIZE]>=0").c_str());
    Printer out;
    cache.lock(10000);
    int rc = cache.executeQueryEx(out, query, 60000, 3600);  // 60 s budget, cache valid 1 h
    cache.unlock();
    cache.close();
    if (rc != 0) std::fprintf(stderr, "query failed: %d\n", rc);
    return rc == 0 ? 0 : 2;
}
