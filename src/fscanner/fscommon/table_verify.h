// State of a table's integrity guard (FS_Table::verify): the first damage
// found, and for every hash index the bucket that each record number is filed
// under, so that a read can tell a record whose key no longer fits its entry.
#ifndef FSCANNER_FSCOMMON_TABLE_VERIFY_H
#define FSCANNER_FSCOMMON_TABLE_VERIFY_H

#include <cstdint>
#include <string>
#include <vector>

class Index;

struct TableGuard {
    // A record number with no entry in an index (its field was null at
    // insert) has this bucket, and its key is not checked.
    static constexpr uint32_t UNKNOWN_BUCKET = 0xFFFFFFFFu;

    struct IndexBuckets {
        // Compared only, never followed: the table's own list says which
        // indexes are still there.
        Index* index;
        std::wstring field;
        std::vector<uint32_t> bucketOf;
    };

    bool damaged = false;
    std::wstring file;
    char const* check = nullptr;
    // The first write the disk refused (FS_Table::writeFailed), with the
    // errno it left and the file.
    bool writeFailed = false;
    int writeError = 0;
    std::wstring writeFile;
    std::vector<IndexBuckets> indexes;
};

#endif
