// The system mount table as a list of rows, and the rules that sort a row's
// file system into dummy (nothing to scan) and remote (reached over a
// network).
//
// MountTableManager holds no instance state.  remoteFileSystems is a
// process-wide list that the host may fill before the first query; nothing in
// this library adds to it, and it is unguarded.
#ifndef FSCANNER_FSCOMMON_MOUNTLIST_H
#define FSCANNER_FSCOMMON_MOUNTLIST_H

#include <list>
#include <string>
#include <vector>

// One row of the mount table.  Owns its three strings (kelm_malloc); a new
// entry is all zero (null strings, both flags false).
class MountEntry {
public:
    MountEntry();
    // Deep copy of all five fields.
    MountEntry(const MountEntry& other);
    MountEntry& operator=(const MountEntry& other);
    ~MountEntry();

    // Each setter frees the old text and stores a copy (null stays null).
    void setDevName(const char* value);
    void setMountDir(const char* value);
    void setFileSystemType(const char* value);
    void setDummy(bool value) { dummy = value; }
    void setRemote(bool value) { remote = value; }

    char* getDevName() const { return devName; }
    char* getMountDir() const { return mountDir; }
    char* getFileSystemType() const { return fileSystemType; }
    bool isDummy() const { return dummy; }
    bool isRemote() const { return remote; }

    // Frees the three strings and leaves them null.
    void freeEntryValues();

private:
    // Frees *target and stores a kelm_malloc copy of value there.
    static void setEntryValue(char** target, const char* value);

    char* devName;
    char* mountDir;
    char* fileSystemType;
    bool dummy;
    bool remote;
};

class MountTableManager {
public:
    // File system types that the host declares remote: a mount of any type in
    // this list is remote.  Empty at load; filled only by the host.
    static std::list<std::string> remoteFileSystems;

    // True when type is one of the pseudo file systems that hold nothing to
    // scan ("autofs", "proc", "sysfs", "rootfs", ...).  Null is not dummy.
    static bool isDummyFileSystem(char* type);

    // True when a mount of device dev with file system type type lies on
    // another machine.  Nulls count as empty text.
    static bool isRemoteFileSystem(char* dev, char* type);

    // Appends every row of the mount table in table order.  True when the
    // table was opened and closed without fault; an unopenable table leaves
    // the list as it was and gives false.
    static bool getMountEntryList(std::vector<MountEntry>& list);

    // Test seam: the file read by getMountEntryList, "/etc/mtab" by default.
    // Null or empty restores the default.  Process-wide, unguarded.
    static void setMountTablePath(const char* path);
    static const char* getMountTablePath();

    static const char* const DEFAULT_MOUNT_TABLE_PATH;
};

#endif
