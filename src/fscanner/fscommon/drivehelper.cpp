#include "fscanner/fscommon/drivehelper.h"

#include <dirent.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <string>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/automounter.h"
#include "fscanner/fscommon/mountlist.h"
#include "fscanner/fscommon/wildcard.h"

const char* const DriveHelper::DEFAULT_AUTOMOUNTER_MASTER_PATH = "/etc/auto.master";

namespace {

std::string& automounterMasterPath() {
    static std::string path(DriveHelper::DEFAULT_AUTOMOUNTER_MASTER_PATH);
    return path;
}

// text converted by convert (mbstowcs or wcstombs: measured first, then
// written); false, out empty, for a null text or one that can't be converted.
template <class From, class To>
bool convertText(const From* text, std::basic_string<To>& out,
                 size_t (*convert)(To*, const From*, size_t)) {
    out.clear();
    if (!text) return false;
    size_t length = convert(nullptr, text, 0);
    if (length == static_cast<size_t>(-1)) return false;
    std::vector<To> buffer(length + 1, To());
    if (convert(buffer.data(), text, length + 1) == static_cast<size_t>(-1)) return false;
    out.assign(buffer.data(), length);
    return true;
}

// Wide form of a narrow text by mbstowcs; false when it can't be converted.
bool toWide(const char* text, std::wstring& out) { return convertText(text, out, mbstowcs); }

// Narrow form of a wide text by wcstombs; false when it can't be converted.
bool toNarrow(const wchar_t* text, std::string& out) { return convertText(text, out, wcstombs); }

bool isHostsDirectory(const char* dir) {
    return dir && (strcmp(dir, "/net") == 0 || strcmp(dir, "/smb") == 0);
}

}  // namespace

namespace {

// Dummy file system types that the kernel serves itself, with no automount
// points inside.  "autofs", "ignore" and "rootfs" are not among them: under
// those a look-up may still wake the automounter.
bool isKernelPseudoFileSystem(const char* type) {
    static const char* const kinds[] = {"proc",    "procfs",  "sysfs",      "devpts", "devfs",
                                        "fdesc",   "debugfs", "fusectl",    "securityfs", "secfs2"};
    if (type == nullptr) return false;
    for (const char* kind : kinds)
        if (strcmp(type, kind) == 0) return true;
    return false;
}

}  // namespace

void accessToAllMountPaths() {
    QvLogWrapper* log = getQvLogFs();
    std::vector<MountEntry> entries;
    MountTableManager::getMountEntryList(entries);
    for (const MountEntry& entry : entries) {
        if (!entry.isDummy()) continue;
        const char* dir = entry.getMountDir() ? entry.getMountDir() : "";
        log->traceMID(__LINE__, __FILE__, __func__,
                      "accessToAllMountPaths - accessing path '%s' with special '%s'", dir,
                      entry.getDevName() ? entry.getDevName() : "");
        if (isHostsDirectory(dir)) {
            // Listing these would reach out to every host on the network.
            log->traceMID(__LINE__, __FILE__, __func__,
                          "accessToAllMountPaths - skipping - assuming remote");
            continue;
        }
        // The look-ups are there to make the automounter mount its keys.  In
        // a kernel's own pseudo file system (/proc alone has an entry per
        // process) no look-up reaches the automounter, so none is made: the
        // drive list and the traces are the same either way.
        if (isKernelPseudoFileSystem(entry.getFileSystemType())) continue;
        fscanner::Env* env = fscanner::Env::Current();
        DIR* directory = env->openDirectory(dir);
        if (!directory) continue;
        struct dirent* item;
        while ((item = env->readDirectory(directory)) != nullptr) {
            if (strcmp(item->d_name, ".") == 0 || strcmp(item->d_name, "..") == 0) continue;
            char path[4096];
            int written = snprintf(path, sizeof(path), "%s/%s/__dummy__", dir, item->d_name);
            if (written < 0 || static_cast<size_t>(written) >= sizeof(path)) continue;
            // The look-up alone makes the automounter mount that key; the
            // answer does not matter.
            struct stat status;
            (void)env->status(path, &status);
        }
        env->closeDirectory(directory);
    }
}

bool checkFileSystems(const wchar_t* name, std::vector<FileSystemInfo>& list, bool caseSensitive) {
    if (!name) return false;
    for (const FileSystemInfo& entry : list) {
        const wchar_t* entryName = entry.getFileSystemName();
        if (entryName && wcsvccmp(entryName, name, caseSensitive) == 0) return true;
    }
    return false;
}

DriveHelper::DriveHelper() : log(getQvLogFs()), noAutoFS(0), assumeAutoFSDriveType(dtAutoFS) {}

void DriveHelper::setNoAutoFS(unsigned int value) { noAutoFS = value; }

void DriveHelper::setAssumeAutoFSDriveType(DriveType value) { assumeAutoFSDriveType = value; }

void DriveHelper::setAutomounterMasterPath(const char* path) {
    automounterMasterPath() = (path && *path) ? path : DEFAULT_AUTOMOUNTER_MASTER_PATH;
}

const char* DriveHelper::getAutomounterMasterPath() { return automounterMasterPath().c_str(); }

int DriveHelper::buildDriveList(std::vector<DriveInfo>& out, unsigned int mask) {
    // Wake the automounter first, so that the table read next holds what the
    // touching mounted.
    if (noAutoFS == 0 && assumeAutoFSDriveType == dtAutoFS) {
        log->traceMID(__LINE__, __FILE__, __func__,
                      "DriveHelper::buildDriveList - accessing all mount paths\n");
        accessToAllMountPaths();
    } else {
        log->traceMID(__LINE__, __FILE__, __func__,
                      "DriveHelper::buildDriveList - skipping accessing all mount paths\n");
    }

    std::vector<MountEntry> entries;
    MountTableManager::getMountEntryList(entries);

    {
        std::vector<MountEntry> automounted;
        try {
            AutomounterConfigParser parser(getAutomounterMasterPath());
            parser.parse();
            for (const std::string& dir : parser.getRemoteMountPoints()) {
                CpuThreshold::doIteration();
                MountEntry entry;
                entry.setMountDir(dir.c_str());
                entry.setDevName(":");
                entry.setFileSystemType("nfs");
                entry.setRemote(true);
                entry.setDummy(false);
                automounted.push_back(entry);
                log->traceMID(__LINE__, __FILE__, __func__,
                              "DriveHelper::buildDriveList - inserted automounter mountpoint: '%s'",
                              dir.c_str());
            }
            entries.insert(entries.end(), automounted.begin(), automounted.end());
        } catch (const std::string& error) {
            // What was collected before the failure is not used.
            log->traceMID(__LINE__, __FILE__, __func__,
                          "DriveHelper::buildDriveList - unable to read automounter configuration (%s)",
                          error.c_str());
        }
    }

    for (const MountEntry& entry : entries) {
        CpuThreshold::doIteration();
        const char* device = entry.getDevName() ? entry.getDevName() : "";
        const char* dir = entry.getMountDir() ? entry.getMountDir() : "";
        const char* type = entry.getFileSystemType() ? entry.getFileSystemType() : "";
        unsigned int kind = assumeAutoFSDriveType;
        if (entry.isDummy() && isHostsDirectory(dir)) {
            log->traceMID(__LINE__, __FILE__, __func__,
                          "accessToAllMountPaths - assuming '-hosts' drive to be remote");
            kind = dtRemote;
        }
        if (entry.isDummy() && kind == dtAutoFS) continue;
        log->traceMID(__LINE__, __FILE__, __func__, "DriveHelper::buildDriveList - [%s] [%s] [%s]\n",
                      device, dir, type);
        if (!entry.isDummy()) {
            kind = entry.isRemote() ? dtRemote : dtLocal;
        } else {
            log->traceMID(__LINE__, __FILE__, __func__,
                          "DriveHelper::buildDriveList - assuming %s to be %d\n", dir, kind);
        }
        if ((mask & kind) == 0) continue;

        std::wstring name;
        std::wstring fileSystem;
        if (!toWide(dir, name) || !toWide(type, fileSystem)) continue;
        if (name.empty() || name[name.size() - 1] != L':') name += L':';

        if (strcmp(type, "dfs") == 0) {
            out.push_back(DriveInfo(name.c_str(), dtRemote, fileSystem.c_str()));
            log->traceMID(__LINE__, __FILE__, __func__, "DriveHelper::buildDriveList - drive: %S, %d\n",
                          name.c_str(), static_cast<int>(dtRemote));
            out.push_back(DriveInfo(name.c_str(), dtLocal, fileSystem.c_str()));
            log->traceMID(__LINE__, __FILE__, __func__, "DriveHelper::buildDriveList - drive: %S, %d\n",
                          name.c_str(), static_cast<int>(dtLocal));
        } else {
            DriveType driveType = strcmp(type, "rootfs") == 0 ? dtLocal : static_cast<DriveType>(kind);
            out.push_back(DriveInfo(name.c_str(), driveType, fileSystem.c_str()));
            log->traceMID(__LINE__, __FILE__, __func__, "DriveHelper::buildDriveList - drive: %S, %d\n",
                          name.c_str(), static_cast<int>(driveType));
        }
    }
    log->traceMID(__LINE__, __FILE__, __func__, "DriveHelper::buildDriveList - exit.\n");
    return 1;
}

void DriveHelper::fileSystemDriveListPruning(std::vector<DriveInfo>& in, std::vector<DriveInfo>& out,
                                             std::vector<FileSystemInfo>& includedFileSystems,
                                             std::vector<FileSystemInfo>& excludedFileSystems,
                                             bool caseSensitive,
                                             std::vector<PathInfo>& excludedPaths) {
    for (DriveInfo& drive : in) {
        CpuThreshold::doIteration();
        const wchar_t* driveName = drive.getDriveName() ? drive.getDriveName() : L"";
        const wchar_t* fileSystem = drive.getDriveFileSystem() ? drive.getDriveFileSystem() : L"";
        // File system names never depend on case, whatever the query says.
        bool dropped = false;
        if (!includedFileSystems.empty() && !checkFileSystems(fileSystem, includedFileSystems, false))
            dropped = true;
        else if (!excludedFileSystems.empty() &&
                 checkFileSystems(fileSystem, excludedFileSystems, false))
            dropped = true;
        if (dropped) {
            log->traceMID(__LINE__, __FILE__, __func__,
                          "DriveHelper::fileSystemDriveListPruning - drive '%S' with '%S' fileSystem excluded!\n",
                          driveName, fileSystem);
            continue;
        }

        std::wstring name(driveName);
        if (!name.empty() && name[name.size() - 1] == L':') name.erase(name.size() - 1);
        bool excluded = false;
        for (const PathInfo& path : excludedPaths) {
            if (!path.getPathName()) continue;
            std::wstring pattern(path.getPathName());
            size_t length = pattern.size();
            if (length >= 2 && pattern.compare(length - 2, 2, L"/*") == 0)
                pattern.erase(length - 2);
            else if (length >= 1 && pattern[length - 1] == L'/')
                pattern.erase(length - 1);  // so "/" becomes empty
            if (wildvcpathcmp(pattern.c_str(), name.c_str(), path.getRecursive(), caseSensitive)) {
                drive.setExcludedDrive(true);
                excluded = true;
                break;
            }
        }
        if (excluded) continue;
        out.push_back(drive);
    }
}

int DriveHelper::checkDrive(const std::vector<DriveInfo>& list, const wchar_t* name, bool caseSensitive) {
    if (!name || list.empty()) return -1;
    size_t length = wcslen(name);
    if (length == 0 || name[length - 1] != L':') return -1;
    for (size_t i = 0; i < list.size(); ++i) {
        const wchar_t* driveName = list[i].getDriveName();
        if (!driveName || wcslen(driveName) < length) continue;
        if (wcsnvccmp(driveName, name, length, caseSensitive) == 0) return static_cast<int>(i);
    }
    return -1;
}

DriveType DriveHelper::getDriverType(wchar_t* mountDir) {
    std::string dir;
    if (!toNarrow(mountDir, dir)) return dtUnknown;
    std::vector<MountEntry> entries;
    MountTableManager::getMountEntryList(entries);
    DriveType result = dtUnknown;
    for (const MountEntry& entry : entries) {
        if (entry.isDummy() || !entry.getMountDir()) continue;
        if (dir == entry.getMountDir()) result = entry.isRemote() ? dtRemote : dtLocal;
    }
    return result;
}
