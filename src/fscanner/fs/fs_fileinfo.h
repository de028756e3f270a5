// Result record and the small value records every path and drive algorithm
// passes around: FsFileInfo, PathInfo, DriveInfo, PathDrive, FileSystemInfo
// and the DriveType bits with the drive group masks built over them.
//
// All text is wide.  Each record owns its strings and copies them deeply:
// FsFileInfo with new[]/delete[], the others with kelm_malloc/kelm_free.
// None of these objects has a lock.
#ifndef FSCANNER_FS_FS_FILEINFO_H
#define FSCANNER_FS_FS_FILEINFO_H

#include <cwchar>
#include <vector>

class FsSerializator;
struct stat;

// Kinds of drive.  Every value is a single bit so that a set of kinds is a
// plain mask (see the drive group masks below).
enum DriveType {
    dtUnknown = 0,     // no mount table row matches the path
    dtReserved1 = 1,   // in the all-drives mask, assigned by nothing here
    dtLocal = 2,       // a local mount, every "rootfs" entry, the local twin of "dfs"
    dtRemote = 4,      // a remote mount, automounter "-hosts", the remote twin of "dfs"
    dtReserved8 = 8,   // in the all-drives mask, assigned by nothing here
    dtReserved16 = 16, // in the all-drives mask, assigned by nothing here
    dtAutoFS = 32      // automounter entry of unassumed kind; outside mdAllDrives on purpose
};

// Drive groups: masks over the DriveType bits.
enum DriveGroupMask {
    mdAllDrives = 0x1f,
    mdLocalDriveGroup = 0x1b,  // every kind but dtRemote: these trees go through the cache
    mdRemoteDriveGroup = 4,    // dtRemote
    mdOtherDriveGroup = 0      // empty here: a mask test against it never succeeds
};

// One result record.  Scalar fields that describe the file on disk are filled
// lazily from lstat by updateInfo() the first time a lazy getter finds its
// validity bit clear; a value given through a setter is never overwritten.
class FsFileInfo {
public:
    // Attribute bits of attr.  Block devices, pipes and sockets set no type bit.
    static constexpr unsigned int ATTR_DIRECTORY = 0x1;
    static constexpr unsigned int ATTR_OWNER_READ = 0x2;
    static constexpr unsigned int ATTR_OWNER_WRITE = 0x4;
    static constexpr unsigned int ATTR_OWNER_EXECUTE = 0x8;
    static constexpr unsigned int ATTR_GROUP_READ = 0x10;
    static constexpr unsigned int ATTR_GROUP_WRITE = 0x20;
    static constexpr unsigned int ATTR_GROUP_EXECUTE = 0x40;
    static constexpr unsigned int ATTR_OTHERS_READ = 0x80;
    static constexpr unsigned int ATTR_OTHERS_WRITE = 0x100;
    static constexpr unsigned int ATTR_OTHERS_EXECUTE = 0x200;
    static constexpr unsigned int ATTR_SYMLINK = 0x1000;
    static constexpr unsigned int ATTR_REGULAR = 0x2000;
    static constexpr unsigned int ATTR_CHAR_DEVICE = 0x4000;

    // Validity bits of validMask, one per scalar field.
    static constexpr unsigned int VALID_ATTR = 0x1;
    static constexpr unsigned int VALID_SIZE = 0x2;
    static constexpr unsigned int VALID_DEVICE = 0x4;
    static constexpr unsigned int VALID_GROUP_ID = 0x8;
    static constexpr unsigned int VALID_USER_ID = 0x10;
    static constexpr unsigned int VALID_INODE = 0x20;
    static constexpr unsigned int VALID_LAST_ACCESS_TIME = 0x40;
    static constexpr unsigned int VALID_CREATE_TIME = 0x80;
    static constexpr unsigned int VALID_LAST_MODIFY_TIME = 0x100;
    static constexpr unsigned int VALID_LINK_COUNT = 0x200;
    static constexpr unsigned int VALID_CRC32 = 0x400;
    static constexpr unsigned int VALID_Q32 = 0x800;
    // The ten bits updateInfo fills: attr to linkCount.
    static constexpr unsigned int VALID_STAT_FIELDS = 0x3ff;

    // Values of compare()'s "what".
    static constexpr int COMPARE_PATH = 1;
    static constexpr int COMPARE_NAME = 2;
    static constexpr int COMPARE_FULL_PATH = 3;
    static constexpr int COMPARE_SIZE = 4;

    FsFileInfo();
    FsFileInfo(const FsFileInfo& other);
    FsFileInfo& operator=(const FsFileInfo& other);
    virtual ~FsFileInfo();

    // Releases the strings and restores the state of a new record (md5 and
    // sha256 back to "0").
    void clear();

    // Plain getters: never touch the file.
    const wchar_t* getPath() const { return path; }
    const wchar_t* getName() const { return name; }
    const wchar_t* getMD5() const { return md5; }
    const wchar_t* getSHA256() const { return sha256; }
    unsigned int getCRC32() const { return crc32; }
    unsigned int getQ32() const { return q32; }

    // Lazy getters: call updateInfo() first when the field's bit is clear,
    // then return the field whatever the outcome (0 if never filled).
    unsigned int getAttr() const;
    unsigned long long getSize() const;
    unsigned int getGroupId() const;
    unsigned int getUserId() const;
    unsigned int getINode() const;
    long getLastAccessTime() const;
    long getCreateTime() const;
    long getLastModifyTime() const;

    // Raw accessors for serialisers and tests: no lazy fill.
    unsigned int getDevice() const { return device; }
    unsigned int getLinkCount() const { return linkCount; }
    unsigned int getValidMask() const { return validMask; }
    bool getStatFailed() const { return statFailed; }

    // Setters that also set the field's validity bit.
    void setFileAttr(unsigned int value);
    void setFileSize(unsigned long long value);
    void setCreateTime(long value);
    void setLastAccessTime(long value);
    void setLastModifyTime(long value);
    void setCRC32(unsigned int value);
    void setQ32(unsigned int value);

    // String setters: release the old string, store a new[] copy (null stays null).
    void setFilePath(const wchar_t* value);
    void setFileName(const wchar_t* value);
    void setMD5(const wchar_t* value);
    void setSHA256(const wchar_t* value);

    // Fills every field of the ten lstat bits that is still clear.  True when
    // all ten are valid afterwards.  Without path or name the file is not
    // touched.  On lstat failure sets statFailed, leaves validMask and returns
    // false; the next lazy getter tries again.
    bool updateInfo() const;

    // Fills every field of the ten lstat bits that is still clear from
    // status, as a successful updateInfo does from its own call.
    // For a caller that already holds the entry's status (a walk's fstatat
    // on the directory's descriptor).  status has the large-file layout the
    // library is built with (_FILE_OFFSET_BITS=64 on 32-bit targets).
    void setStatus(const struct stat& status);

    // Compares this record (left) with other (right) through
    // checkSimpleExpression; what: 1 path, 2 name, 3 full path, 4 size (raw,
    // no lazy fill).  Any other what gives false.
    bool compare(FsFileInfo& other, int what, unsigned int op, bool caseSensitive);

    // Record layout through the serialiser: path, name, md5, sha256, validMask,
    // then each scalar whose bit is set in rising bit order, then the
    // end-of-record call.  Both return the serialiser's last error (0 = fine).
    // statFailed is not stored.  Defined beside the serialiser.
    int saveObject(FsSerializator& serializator) const;
    int loadObject(FsSerializator& serializator);

    // new[] copy of a wide string; null for null or a failed allocation.
    static wchar_t* duplicateString(const wchar_t* value);

private:
    void releaseStrings();
    void copyFrom(const FsFileInfo& other);
    void fillFromStatus(const struct stat& status) const;

    wchar_t* path;
    wchar_t* name;
    wchar_t* md5;
    wchar_t* sha256;
    mutable unsigned int attr;
    mutable unsigned long long size;
    mutable unsigned int device;
    mutable unsigned int groupId;
    mutable unsigned int userId;
    mutable unsigned int iNode;
    mutable long lastAccessTime;
    mutable long createTime;
    mutable long lastModifyTime;
    mutable unsigned int linkCount;
    mutable unsigned int validMask;
    mutable bool statFailed;
    unsigned int crc32;
    unsigned int q32;
};

// A path with its recursive flag.  pathName is owned (kelm_free) and may be null.
class PathInfo {
public:
    PathInfo();
    PathInfo(const wchar_t* pathName, bool recursive);
    PathInfo(const PathInfo& other);
    PathInfo& operator=(const PathInfo& other);
    ~PathInfo();

    void setPathInfo(const PathInfo& other);
    wchar_t* getPathName() const { return pathName; }
    bool getRecursive() const { return recursive; }

    // By pathName alone (wcscmp); both must be non-null.  A null sorts first so
    // that a damaged entry never crashes an ordered container.
    bool operator<(const PathInfo& other) const;
    // Both names null or equal by wcscmp, and equal recursive flags.
    bool operator==(const PathInfo& other) const;

private:
    wchar_t* pathName;
    bool recursive;
};

// A drive, that is a mount point, named by its mount directory plus ":".
class DriveInfo {
public:
    DriveInfo();
    DriveInfo(const wchar_t* name, DriveType type, const wchar_t* fileSystem);
    // Copies every field, excludedDrive included.
    DriveInfo(const DriveInfo& other);
    // Both go through setDriveInfo: excludedDrive of the target is kept.
    DriveInfo& operator=(const DriveInfo& other);
    ~DriveInfo();

    // Copies name, file system and type, never excludedDrive.  When either
    // source string is null both target strings become null (type still copied).
    void setDriveInfo(const DriveInfo& other);

    wchar_t* getDriveName() const { return driveName; }
    wchar_t* getDriveFileSystem() const { return driveFileSystem; }
    DriveType getDriveType() const { return driveType; }
    bool getExcludedDrive() const { return excludedDrive; }
    void setExcludedDrive(bool value) { excludedDrive = value; }

    // Type, name and file system equal (wcscmp); excludedDrive plays no part.
    bool operator==(const DriveInfo& other) const;

private:
    void releaseStrings();

    wchar_t* driveName;
    wchar_t* driveFileSystem;
    DriveType driveType;
    bool excludedDrive;
};

// A path and the drive it lies on.  Both halves are bases, so a PathDrive is
// passed wherever a PathInfo or DriveInfo is read; "first" and "second" name
// the same two halves.  Copies go through setDriveInfo, so a copy always
// starts with excludedDrive false.
class PathDrive : public PathInfo, public DriveInfo {
public:
    PathDrive();
    PathDrive(const PathInfo& path, const DriveInfo& drive);
    PathDrive(const wchar_t* pathName, bool recursive, const DriveInfo& drive);
    PathDrive(const PathDrive& other);
    PathDrive& operator=(const PathDrive& other);
    ~PathDrive();

    bool operator==(const PathDrive& other) const;
    bool operator<(const PathDrive& other) const { return PathInfo::operator<(other); }

    PathInfo& first;
    DriveInfo& second;
};

// Name of a file system type such as "nfs" or "dfs".  Owned, may be null.
class FileSystemInfo {
public:
    FileSystemInfo();
    explicit FileSystemInfo(const wchar_t* fileSystemName);
    FileSystemInfo(const FileSystemInfo& other);
    FileSystemInfo& operator=(const FileSystemInfo& other);
    ~FileSystemInfo();

    void setFileSystemInfo(const FileSystemInfo& other);
    wchar_t* getFileSystemName() const { return fileSystemName; }
    // By wcscmp; two nulls are equal, a null and a name are not.
    bool operator==(const FileSystemInfo& other) const;

private:
    wchar_t* fileSystemName;
};

// Path-list helpers over the records above.  They sit with the records, not
// with the pattern matchers of wildcard.h they use, so that the text helpers
// never need to know a record.
//
// True at the first entry that matches path.  With onlyRecursive false an
// entry matches by wildvcpathcmp(entry, path, entry's recursive flag); with
// it true non-recursive entries are passed over and the others are tested as
// recursive.  An empty list, a null path or a nameless entry never matches.
bool checkPathList(const wchar_t* path, const std::vector<PathInfo>& list, bool caseSensitive,
                   bool onlyRecursive);

// New new[] string: path, one separator unless path is empty or ends in one,
// name.  Null if either argument is null or the allocation fails.  The caller
// releases it with delete[].
wchar_t* getPathName(const wchar_t* path, const wchar_t* name);

#endif
