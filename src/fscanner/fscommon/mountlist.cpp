#include "fscanner/fscommon/mountlist.h"

#include <mntent.h>

#include <cstdio>
#include <cstring>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"

std::list<std::string> MountTableManager::remoteFileSystems;

const char* const MountTableManager::DEFAULT_MOUNT_TABLE_PATH = "/etc/mtab";

namespace {

std::string& mountTablePath() {
    static std::string path(MountTableManager::DEFAULT_MOUNT_TABLE_PATH);
    return path;
}

}  // namespace

// --- MountEntry ---------------------------------------------------------

MountEntry::MountEntry() : devName(nullptr), mountDir(nullptr), fileSystemType(nullptr),
                           dummy(false), remote(false) {}

MountEntry::MountEntry(const MountEntry& other)
    : devName(nullptr), mountDir(nullptr), fileSystemType(nullptr), dummy(other.dummy),
      remote(other.remote) {
    setEntryValue(&devName, other.devName);
    setEntryValue(&mountDir, other.mountDir);
    setEntryValue(&fileSystemType, other.fileSystemType);
}

MountEntry& MountEntry::operator=(const MountEntry& other) {
    if (this != &other) {
        setEntryValue(&devName, other.devName);
        setEntryValue(&mountDir, other.mountDir);
        setEntryValue(&fileSystemType, other.fileSystemType);
        dummy = other.dummy;
        remote = other.remote;
    }
    return *this;
}

MountEntry::~MountEntry() { freeEntryValues(); }

void MountEntry::setEntryValue(char** target, const char* value) {
    // Copy first: value may be the very text that *target holds.
    char* copy = value ? i_strdup(value) : nullptr;
    kelm_free(*target);
    *target = copy;
}

void MountEntry::setDevName(const char* value) { setEntryValue(&devName, value); }
void MountEntry::setMountDir(const char* value) { setEntryValue(&mountDir, value); }
void MountEntry::setFileSystemType(const char* value) { setEntryValue(&fileSystemType, value); }

void MountEntry::freeEntryValues() {
    kelm_free(devName);
    kelm_free(mountDir);
    kelm_free(fileSystemType);
    devName = nullptr;
    mountDir = nullptr;
    fileSystemType = nullptr;
}

// --- MountTableManager --------------------------------------------------

void MountTableManager::setMountTablePath(const char* path) {
    mountTablePath() = (path && *path) ? path : DEFAULT_MOUNT_TABLE_PATH;
}

const char* MountTableManager::getMountTablePath() { return mountTablePath().c_str(); }

bool MountTableManager::isDummyFileSystem(char* type) {
    static const char* const dummyTypes[] = {
        "autofs", "ignore",  "devfs",      "devpts", "fdesc",  "proc",  "procfs",
        "sysfs",  "debugfs", "fusectl",    "securityfs", "secfs2", "rootfs"};
    bool result = false;
    if (type) {
        for (const char* dummyType : dummyTypes) {
            if (strcmp(type, dummyType) == 0) {
                result = true;
                break;
            }
        }
    }
    getQvLogFs()->traceMAX(__LINE__, __FILE__, __func__,
                           "MountTableManager::isDummyFileSystem - fileSystemType: '%s' is dummy: '%s'",
                           type ? type : "", result ? "true" : "false");
    return result;
}

bool MountTableManager::isRemoteFileSystem(char* dev, char* type) {
    const char* device = dev ? dev : "";
    const char* fsType = type ? type : "";
    for (const std::string& name : remoteFileSystems) {
        if (name == fsType) return true;
    }
    if (strchr(device, ':') != nullptr) return true;
    if (strncmp(device, "//", 2) == 0 && strcmp(fsType, "smbfs") == 0) return true;
    if (strcmp(fsType, "ncpfs") == 0 || strcmp(fsType, "cifs") == 0) return true;
    // Prefix tests on purpose: "nfs4" and "gpfs2" are remote too.
    if (strncmp(fsType, "nfs", 3) == 0 || strncmp(fsType, "gpfs", 4) == 0) return true;
    if (strcmp(fsType, "mvfs") == 0) return true;
    return false;
}

bool MountTableManager::getMountEntryList(std::vector<MountEntry>& list) {
    QvLogWrapper* log = getQvLogFs();
    log->traceMAX(__LINE__, __FILE__, __func__,
                  "MountTableManager::getMountEntryList - MOUNTED_GETMNTENT1 defined!\n");
    bool retValue = false;
    // The table is opened through the Env and only parsed by getmntent.
    fscanner::Env* env = fscanner::Env::Current();
    FILE* table = env->openStream(getMountTablePath(), "r");
    if (table) {
        retValue = true;
        struct mntent* row;
        while ((row = getmntent(table)) != nullptr) {
            MountEntry entry;
            entry.setDevName(row->mnt_fsname ? row->mnt_fsname : "");
            entry.setMountDir(row->mnt_dir ? row->mnt_dir : "");
            entry.setFileSystemType(row->mnt_type ? row->mnt_type : "");
            entry.setDummy(isDummyFileSystem(entry.getFileSystemType()));
            entry.setRemote(isRemoteFileSystem(entry.getDevName(), entry.getFileSystemType()));
            list.push_back(entry);
        }
        env->closeStream(table);
    }
    log->traceMAX(__LINE__, __FILE__, __func__,
                  "MountTableManager::getMountEntryList - mountEntryList size is %d!\n",
                  static_cast<int>(list.size()));
    log->traceMAX(__LINE__, __FILE__, __func__,
                  "MountTableManager::getMountEntryList - exiting with retValue = %s!\n",
                  retValue ? "true" : "false");
    return retValue;
}
