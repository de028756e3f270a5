// Reads a mount table of arbitrary bytes through MountTableManager and sorts
// every row it gives into dummy and remote file systems.
//
// Input: the table file's bytes.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <vector>

#include "fscanner/fscommon/mountlist.h"
#include "fuzz_support.h"

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    static std::string path = fuzzsupport::tempDir() + "/mtab";
    fuzzsupport::writeFile(path, data, size);
    MountTableManager::setMountTablePath(path.c_str());
    std::vector<MountEntry> rows;
    if (!MountTableManager::getMountEntryList(rows)) std::abort();  // the file exists
    for (MountEntry& row : rows) {
        MountTableManager::isDummyFileSystem(row.getFileSystemType());
        MountTableManager::isRemoteFileSystem(row.getDevName(), row.getFileSystemType());
        MountEntry copy(row);
        copy = row;
    }
    return 0;
}
