// Helpers for suites that run whole queries through the cache classes: a
// writer that collects hits as full paths, the same listing from find(1), and
// a machine of fixtures (mount table, automounter master, lock store and
// trace directory in temporary directories).
#ifndef FSCANNER_TESTS_SUPPORT_CACHEFIXTURE_H
#define FSCANNER_TESTS_SUPPORT_CACHEFIXTURE_H

#include <set>
#include <string>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace testsupport {

// Bytes of a wide text whose characters are all below 256.
inline std::string bytesOf(const wchar_t* w)
{
    std::string out;
    for (; w != nullptr && *w != L'\0'; ++w)
        out += static_cast<char>(*w);
    return out;
}

inline std::string joinPath(const std::string& dir, const std::string& name)
{
    if (!dir.empty() && dir.back() == '/')
        return dir + name;
    return dir + "/" + name;
}

// Options of a cache that computes no checksums and walks remote trees
// directly.
inline FsGlue plainGlue()
{
    FsGlue glue;
    glue.knownHashes = nullptr;
    glue.checksumFlags = 0;
    glue.reserved = 0;
    glue.cacheRemoteDrives = false;
    return glue;
}

// Collects the full path of every hit, from either form of addRecord.
class HitWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long, unsigned int,
                  const wchar_t*, unsigned int, unsigned int) override {
        hits.insert(joinPath(bytesOf(path), bytesOf(name)));
        ++records;
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        hits.insert(joinPath(bytesOf(info.getPath()), bytesOf(info.getName())));
        ++records;
        return 0;
    }
    int close() override { return 0; }
    std::set<std::string> hits;
    size_t records = 0;
};

// Regular files and links below root as find(1) lists them (NUL-separated,
// so that names with newlines survive), extra being more find arguments.
inline std::set<std::string> findFiles(const std::string& root, const std::string& extra = "")
{
    std::string out = runCommand("find '" + root + "' ! -type d " + extra + " -print0 2>/dev/null");
    std::set<std::string> files;
    size_t pos = 0;
    while (pos < out.size()) {
        size_t end = out.find('\0', pos);
        if (end == std::string::npos)
            end = out.size();
        if (end > pos)
            files.insert(out.substr(pos, end - pos));
        pos = end + 1;
    }
    return files;
}

// One local root file system "/" of type ext4, an empty automounter master,
// locks and traces in temporary directories.  Restores the seams on exit.
struct MachineFixture {
    TempDir locks;
    TempDir sys;
    TempDir traces;
    MachineFixture() {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        sys.write("auto.master", "");
        sys.write("mtab", "/dev/sda1 / ext4 rw 0 0\n");
        MountTableManager::setMountTablePath(sys.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(sys.file("auto.master").c_str());
        KelCfg::setKey("common_trace_path", traces.path().c_str());
    }
    ~MachineFixture() {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
        KelCfg::removeKey("common_trace_path");
    }
};

}  // namespace testsupport

#endif
