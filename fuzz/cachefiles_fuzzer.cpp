// Reads the cache's ex_hash and cat_set files made of arbitrary bytes, writes
// what was understood back and reads it again: the second reading must give
// exactly the first one.
//
// Input: the length of the ex_hash bytes as a 16-bit little-endian word, the
// ex_hash bytes, then the cat_set bytes.
#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fuzz_support.h"
#include "support/cachefixture.h"

namespace {

struct Cache {
    std::string dir;
    FsGlue glue;
    FS_Cache2* cache;

    Cache() : cache(nullptr) {
        dir = fuzzsupport::tempDir() + "/cache";
        mkdir(dir.c_str(), 0700);
        glue = testsupport::plainGlue();
        cache = new FS_Cache2(L"dirs", L"files", fuzzsupport::widen(dir).c_str(), true, false, &glue, L"fuzz");
    }
};

Cache& cache() {
    static Cache* one = new Cache();
    return *one;
}

typedef std::map<std::string, std::vector<unsigned int> > Marks;

Marks marks(FS_Cache2& cache) {
    Marks out;
    for (auto const& entry : cache.excludeMd5) {
        if (!entry.second.valid) continue;
        out[entry.first] = std::vector<unsigned int>(entry.second.digest, entry.second.digest + 4);
    }
    return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    Cache& c = cache();
    fuzzsupport::ByteReader in(data, size);
    uint16_t exLength = in.word16();
    std::string ex = in.take(exLength);
    std::string cat = in.rest();
    fuzzsupport::writeFile(c.dir + "/ex_hash", ex);
    fuzzsupport::writeFile(c.dir + "/cat_set", cat);

    c.cache->excludeMd5.clear();
    c.cache->readMd5OfExclude();
    Marks first = marks(*c.cache);
    c.cache->writeMd5File();
    c.cache->excludeMd5.clear();
    c.cache->readMd5OfExclude();
    if (marks(*c.cache) != first) std::abort();
    c.cache->excludeMd5.clear();

    FsQuery restored;
    c.cache->saveOrRestoreFilesOrMasksForCaching(restored);
    restored.fileShouldBeCached(L"report.txt");
    if (restored.getFileOrMaskForCachingSetSize() != 0) {
        c.cache->saveOrRestoreFilesOrMasksForCaching(restored);  // writes cat_set anew
        FsQuery again;
        c.cache->saveOrRestoreFilesOrMasksForCaching(again);
        if (again.getFilesForCaching() != restored.getFilesForCaching() ||
            again.getMasksForCaching() != restored.getMasksForCaching())
            std::abort();
    }
    return 0;
}
