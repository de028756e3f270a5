// Reads a result file of arbitrary bytes through FsResultSetReader_OnFile:
// getNext before moveFirst, a full read with a bookmark taken after the
// first record and returned to at the end, then a sort and a second full
// read.
//
// Input: 1 control byte (bits 0-2 sort key, bits 3-4 sort order, bit 5 case
// flag, bit 6 skip the sort), then the file's bytes.
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "fuzz_support.h"

namespace {

// Enough for any file of the sizes the fuzzer makes: a record takes at
// least 20 bytes.
const unsigned int kMaxRecords = 100000;

unsigned int readAll(FsResultSetReader_OnFile& reader, bool bookmark) {
    FsFileInfo info;
    unsigned int records = 0;
    while (records < kMaxRecords && reader.getNext(info) == 1) {
        ++records;
        if (bookmark && records == 1) reader.setBookmark();
    }
    return records;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    std::string const& dir = fuzzsupport::tempDir();
    fuzzsupport::ByteReader in(data, size);
    uint8_t control = in.byte();
    std::string bytes = in.rest();
    std::string path = dir + "/results";
    fuzzsupport::writeFile(path, bytes);
    {
        FsResultSetReader_OnFile reader(path.c_str());
        FsFileInfo info;
        if (reader.getNext(info) != 0) std::abort();  // no file before moveFirst
        reader.moveFirst();
        unsigned int first = readAll(reader, true);
        if (first > 0 && reader.toBookmark() == 1) readAll(reader, false);
        if ((control & 0x40) == 0) {
            unsigned int key = control & 7;
            unsigned int order = (control >> 3) & 3;
            int sorted = reader.sort(key, order, (control & 0x20) != 0);
            if (sorted != ((key >= 1 && key <= 4) ? 1 : 0)) std::abort();
            reader.moveFirst();
            unsigned int second = readAll(reader, false);
            if (std::getenv("FSCANNER_FUZZ_VERBOSE") != nullptr)
                std::fprintf(stderr, "read %u records, sort %u/%u gave %d, then %u records\n", first, key, order,
                             sorted, second);
            // A sort keeps every record it could read; damage after the last
            // whole record may be dropped, never invented.
            if (second > first && first != 0 && key >= 1 && key <= 4 && order >= 1 && order <= 2) std::abort();
        }
    }
    return 0;
}
