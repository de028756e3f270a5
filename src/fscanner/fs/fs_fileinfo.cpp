#include "fscanner/fs/fs_fileinfo.h"

#include <sys/stat.h>
#include <sys/types.h>

#include <cstring>
#include <new>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

bool sameText(const wchar_t* a, const wchar_t* b) {
    if (a == nullptr || b == nullptr) return a == b;
    return wcscmp(a, b) == 0;
}

}  // namespace

// ---------------------------------------------------------------- FsFileInfo

wchar_t* FsFileInfo::duplicateString(const wchar_t* value) {
    if (value == nullptr) return nullptr;
    size_t n = wcslen(value) + 1;
    wchar_t* copy = new (std::nothrow) wchar_t[n];
    if (copy != nullptr) wmemcpy(copy, value, n);
    return copy;
}

FsFileInfo::FsFileInfo()
    : path(nullptr),
      name(nullptr),
      md5(duplicateString(L"0")),
      sha256(duplicateString(L"0")),
      attr(0),
      size(0),
      device(0),
      groupId(0),
      userId(0),
      iNode(0),
      lastAccessTime(0),
      createTime(0),
      lastModifyTime(0),
      linkCount(0),
      validMask(0),
      statFailed(false),
      crc32(0),
      q32(0) {}

FsFileInfo::FsFileInfo(const FsFileInfo& other)
    : path(nullptr), name(nullptr), md5(nullptr), sha256(nullptr) {
    copyFrom(other);
}

FsFileInfo& FsFileInfo::operator=(const FsFileInfo& other) {
    if (this != &other) {
        releaseStrings();
        copyFrom(other);
    }
    return *this;
}

FsFileInfo::~FsFileInfo() { releaseStrings(); }

void FsFileInfo::releaseStrings() {
    delete[] path;
    delete[] name;
    delete[] md5;
    delete[] sha256;
    path = name = md5 = sha256 = nullptr;
}

void FsFileInfo::copyFrom(const FsFileInfo& other) {
    path = duplicateString(other.path);
    name = duplicateString(other.name);
    md5 = duplicateString(other.md5);
    sha256 = duplicateString(other.sha256);
    attr = other.attr;
    size = other.size;
    device = other.device;
    groupId = other.groupId;
    userId = other.userId;
    iNode = other.iNode;
    lastAccessTime = other.lastAccessTime;
    createTime = other.createTime;
    lastModifyTime = other.lastModifyTime;
    linkCount = other.linkCount;
    validMask = other.validMask;
    statFailed = other.statFailed;
    crc32 = other.crc32;
    q32 = other.q32;
}

void FsFileInfo::clear() {
    releaseStrings();
    md5 = duplicateString(L"0");
    sha256 = duplicateString(L"0");
    attr = 0;
    size = 0;
    device = 0;
    groupId = 0;
    userId = 0;
    iNode = 0;
    lastAccessTime = 0;
    createTime = 0;
    lastModifyTime = 0;
    linkCount = 0;
    validMask = 0;
    statFailed = false;
    crc32 = 0;
    q32 = 0;
}

unsigned int FsFileInfo::getAttr() const {
    if ((validMask & VALID_ATTR) == 0) updateInfo();
    return attr;
}

unsigned long long FsFileInfo::getSize() const {
    if ((validMask & VALID_SIZE) == 0) updateInfo();
    return size;
}

unsigned int FsFileInfo::getGroupId() const {
    if ((validMask & VALID_GROUP_ID) == 0) updateInfo();
    return groupId;
}

unsigned int FsFileInfo::getUserId() const {
    if ((validMask & VALID_USER_ID) == 0) updateInfo();
    return userId;
}

unsigned int FsFileInfo::getINode() const {
    if ((validMask & VALID_INODE) == 0) updateInfo();
    return iNode;
}

long FsFileInfo::getLastAccessTime() const {
    if ((validMask & VALID_LAST_ACCESS_TIME) == 0) updateInfo();
    return lastAccessTime;
}

long FsFileInfo::getCreateTime() const {
    if ((validMask & VALID_CREATE_TIME) == 0) updateInfo();
    return createTime;
}

long FsFileInfo::getLastModifyTime() const {
    if ((validMask & VALID_LAST_MODIFY_TIME) == 0) updateInfo();
    return lastModifyTime;
}

void FsFileInfo::setFileAttr(unsigned int value) {
    attr = value;
    validMask |= VALID_ATTR;
}

void FsFileInfo::setFileSize(unsigned long long value) {
    size = value;
    validMask |= VALID_SIZE;
}

void FsFileInfo::setCreateTime(long value) {
    createTime = value;
    validMask |= VALID_CREATE_TIME;
}

void FsFileInfo::setLastAccessTime(long value) {
    lastAccessTime = value;
    validMask |= VALID_LAST_ACCESS_TIME;
}

void FsFileInfo::setLastModifyTime(long value) {
    lastModifyTime = value;
    validMask |= VALID_LAST_MODIFY_TIME;
}

void FsFileInfo::setCRC32(unsigned int value) {
    crc32 = value;
    validMask |= VALID_CRC32;
}

void FsFileInfo::setQ32(unsigned int value) {
    q32 = value;
    validMask |= VALID_Q32;
}

void FsFileInfo::setFilePath(const wchar_t* value) {
    wchar_t* copy = duplicateString(value);
    delete[] path;
    path = copy;
}

void FsFileInfo::setFileName(const wchar_t* value) {
    wchar_t* copy = duplicateString(value);
    delete[] name;
    name = copy;
}

void FsFileInfo::setMD5(const wchar_t* value) {
    wchar_t* copy = duplicateString(value);
    delete[] md5;
    md5 = copy;
}

void FsFileInfo::setSHA256(const wchar_t* value) {
    wchar_t* copy = duplicateString(value);
    delete[] sha256;
    sha256 = copy;
}

static unsigned int attributesOf(mode_t mode) {
    unsigned int bits = 0;
    switch (mode & S_IFMT) {
        case S_IFDIR: bits |= FsFileInfo::ATTR_DIRECTORY; break;
        case S_IFLNK: bits |= FsFileInfo::ATTR_SYMLINK; break;
        case S_IFREG: bits |= FsFileInfo::ATTR_REGULAR; break;
        case S_IFCHR: bits |= FsFileInfo::ATTR_CHAR_DEVICE; break;
        default: break;  // block devices, pipes, sockets: no type bit
    }
    if (mode & S_IRUSR) bits |= FsFileInfo::ATTR_OWNER_READ;
    if (mode & S_IWUSR) bits |= FsFileInfo::ATTR_OWNER_WRITE;
    if (mode & S_IXUSR) bits |= FsFileInfo::ATTR_OWNER_EXECUTE;
    if (mode & S_IRGRP) bits |= FsFileInfo::ATTR_GROUP_READ;
    if (mode & S_IWGRP) bits |= FsFileInfo::ATTR_GROUP_WRITE;
    if (mode & S_IXGRP) bits |= FsFileInfo::ATTR_GROUP_EXECUTE;
    if (mode & S_IROTH) bits |= FsFileInfo::ATTR_OTHERS_READ;
    if (mode & S_IWOTH) bits |= FsFileInfo::ATTR_OTHERS_WRITE;
    if (mode & S_IXOTH) bits |= FsFileInfo::ATTR_OTHERS_EXECUTE;
    return bits;
}

bool FsFileInfo::updateInfo() const {
    bool complete = (validMask & VALID_STAT_FIELDS) == VALID_STAT_FIELDS;
    if (path == nullptr || name == nullptr) return complete;
    if (complete) return true;

    wchar_t* fullPath = getPathName(path, name);
    char* narrow = utils::myWcsToMbsString(fullPath);
    struct stat status;
    bool ok = narrow != nullptr && narrow[0] != 0 && fscanner::Env::Current()->linkStatus(narrow, &status) == 0;
    delete[] narrow;
    if (!ok) {
        getQvLogFs()->traceMAX(__LINE__, __FILE__, __FUNCTION__,
                               "FsFileInfo::updateInfo - lstat(...) failed on '%S' path\n",
                               fullPath != nullptr ? fullPath : L"");
        delete[] fullPath;
        statFailed = true;
        return false;
    }
    delete[] fullPath;
    fillFromStatus(status);
    return true;
}

void FsFileInfo::setStatus(const struct stat& status) {
    fillFromStatus(status);
}

void FsFileInfo::fillFromStatus(const struct stat& status) const {
    if ((validMask & VALID_ATTR) == 0) attr = attributesOf(status.st_mode);
    if ((validMask & VALID_SIZE) == 0) size = static_cast<unsigned long long>(status.st_size);
    if ((validMask & VALID_DEVICE) == 0) device = static_cast<unsigned int>(status.st_dev);
    if ((validMask & VALID_GROUP_ID) == 0) groupId = static_cast<unsigned int>(status.st_gid);
    if ((validMask & VALID_USER_ID) == 0) userId = static_cast<unsigned int>(status.st_uid);
    if ((validMask & VALID_INODE) == 0) iNode = static_cast<unsigned int>(status.st_ino);
    if ((validMask & VALID_LAST_ACCESS_TIME) == 0) lastAccessTime = static_cast<long>(status.st_atime);
    if ((validMask & VALID_CREATE_TIME) == 0) createTime = static_cast<long>(status.st_ctime);
    if ((validMask & VALID_LAST_MODIFY_TIME) == 0) lastModifyTime = static_cast<long>(status.st_mtime);
    if ((validMask & VALID_LINK_COUNT) == 0) linkCount = static_cast<unsigned int>(status.st_nlink);
    validMask |= VALID_STAT_FIELDS;
}

// ------------------------------------------------------------------ PathInfo

PathInfo::PathInfo() : pathName(nullptr), recursive(false) {}

// wcsdup here, kelm_malloc elsewhere: both sit on the C allocator, so
// kelm_free releases either.
PathInfo::PathInfo(const wchar_t* name, bool isRecursive)
    : pathName(name != nullptr ? wcsdup(name) : nullptr), recursive(isRecursive) {}

PathInfo::PathInfo(const PathInfo& other)
    : pathName(wideDuplicate(other.pathName)), recursive(other.recursive) {}

PathInfo& PathInfo::operator=(const PathInfo& other) {
    setPathInfo(other);
    return *this;
}

PathInfo::~PathInfo() { kelm_free(pathName); }

void PathInfo::setPathInfo(const PathInfo& other) {
    if (this == &other) return;
    wchar_t* copy = wideDuplicate(other.pathName);
    kelm_free(pathName);
    pathName = copy;
    recursive = other.recursive;
}

bool PathInfo::operator<(const PathInfo& other) const {
    if (pathName == nullptr || other.pathName == nullptr) {
        return pathName == nullptr && other.pathName != nullptr;
    }
    return wcscmp(pathName, other.pathName) < 0;
}

bool PathInfo::operator==(const PathInfo& other) const {
    return sameText(pathName, other.pathName) && recursive == other.recursive;
}

// ----------------------------------------------------------------- DriveInfo

DriveInfo::DriveInfo()
    : driveName(nullptr), driveFileSystem(nullptr), driveType(dtUnknown), excludedDrive(false) {}

DriveInfo::DriveInfo(const wchar_t* name, DriveType type, const wchar_t* fileSystem)
    : driveName(wideDuplicate(name)),
      driveFileSystem(wideDuplicate(fileSystem)),
      driveType(type),
      excludedDrive(false) {}

// The source is expected to carry both strings; a missing one is copied as
// null rather than read.
DriveInfo::DriveInfo(const DriveInfo& other)
    : driveName(wideDuplicate(other.driveName)),
      driveFileSystem(wideDuplicate(other.driveFileSystem)),
      driveType(other.driveType),
      excludedDrive(other.excludedDrive) {}

DriveInfo& DriveInfo::operator=(const DriveInfo& other) {
    setDriveInfo(other);
    return *this;
}

DriveInfo::~DriveInfo() { releaseStrings(); }

void DriveInfo::releaseStrings() {
    kelm_free(driveName);
    kelm_free(driveFileSystem);
    driveName = nullptr;
    driveFileSystem = nullptr;
}

void DriveInfo::setDriveInfo(const DriveInfo& other) {
    if (this == &other) return;
    if (other.driveName == nullptr || other.driveFileSystem == nullptr) {
        releaseStrings();
    } else {
        wchar_t* name = wideDuplicate(other.driveName);
        wchar_t* fileSystem = wideDuplicate(other.driveFileSystem);
        releaseStrings();
        driveName = name;
        driveFileSystem = fileSystem;
    }
    driveType = other.driveType;
    // excludedDrive stays the target's own.
}

bool DriveInfo::operator==(const DriveInfo& other) const {
    return driveType == other.driveType && sameText(driveName, other.driveName) &&
           sameText(driveFileSystem, other.driveFileSystem);
}

// ----------------------------------------------------------------- PathDrive

PathDrive::PathDrive() : PathInfo(), DriveInfo(), first(*this), second(*this) {}

PathDrive::PathDrive(const PathInfo& path, const DriveInfo& drive)
    : PathInfo(path), DriveInfo(), first(*this), second(*this) {
    setDriveInfo(drive);
}

PathDrive::PathDrive(const wchar_t* pathName, bool recursive, const DriveInfo& drive)
    : PathInfo(pathName, recursive), DriveInfo(), first(*this), second(*this) {
    setDriveInfo(drive);
}

PathDrive::PathDrive(const PathDrive& other)
    : PathInfo(other), DriveInfo(), first(*this), second(*this) {
    setDriveInfo(other);
}

PathDrive& PathDrive::operator=(const PathDrive& other) {
    setPathInfo(other);
    setDriveInfo(other);
    return *this;
}

PathDrive::~PathDrive() {}

bool PathDrive::operator==(const PathDrive& other) const {
    return PathInfo::operator==(other) && DriveInfo::operator==(other);
}

// ------------------------------------------------------------ FileSystemInfo

FileSystemInfo::FileSystemInfo() : fileSystemName(nullptr) {}

FileSystemInfo::FileSystemInfo(const wchar_t* name) : fileSystemName(wideDuplicate(name)) {}

FileSystemInfo::FileSystemInfo(const FileSystemInfo& other)
    : fileSystemName(wideDuplicate(other.fileSystemName)) {}

FileSystemInfo& FileSystemInfo::operator=(const FileSystemInfo& other) {
    setFileSystemInfo(other);
    return *this;
}

FileSystemInfo::~FileSystemInfo() { kelm_free(fileSystemName); }

void FileSystemInfo::setFileSystemInfo(const FileSystemInfo& other) {
    if (this == &other) return;
    wchar_t* copy = wideDuplicate(other.fileSystemName);
    kelm_free(fileSystemName);
    fileSystemName = copy;
}

bool FileSystemInfo::operator==(const FileSystemInfo& other) const {
    return sameText(fileSystemName, other.fileSystemName);
}

// ------------------------------------------------------------------ compare

bool FsFileInfo::compare(FsFileInfo& other, int what, unsigned int op, bool caseSensitive) {
    switch (what) {
        case COMPARE_PATH:
            return checkSimpleExpression(path, op, other.path, caseSensitive);
        case COMPARE_NAME:
            return checkSimpleExpression(name, op, other.name, caseSensitive);
        case COMPARE_FULL_PATH: {
            wchar_t* left = getPathName(path, name);
            wchar_t* right = getPathName(other.path, other.name);
            bool result = checkSimpleExpression(left, op, right, caseSensitive);
            delete[] left;
            delete[] right;
            return result;
        }
        case COMPARE_SIZE:
            return checkSimpleExpression(size, op, other.size);
        default:
            return false;
    }
}

bool checkPathList(const wchar_t* path, const std::vector<PathInfo>& list, bool caseSensitive,
                   bool onlyRecursive) {
    if (path == nullptr || list.empty()) return false;
    for (size_t i = 0; i < list.size(); ++i) {
        const wchar_t* entry = list[i].getPathName();
        if (entry == nullptr) continue;
        if (onlyRecursive) {
            if (!list[i].getRecursive()) continue;
            if (wildvcpathcmp(entry, path, true, caseSensitive)) return true;
        } else if (wildvcpathcmp(entry, path, list[i].getRecursive(), caseSensitive)) {
            return true;
        }
    }
    return false;
}

wchar_t* getPathName(const wchar_t* path, const wchar_t* name) {
    if (path == nullptr || name == nullptr) return nullptr;
    size_t pathLength = wcslen(path);
    size_t nameLength = wcslen(name);
    bool separator = pathLength > 0 && path[pathLength - 1] != utils::PathSeparator;
    wchar_t* out = new (std::nothrow) wchar_t[pathLength + (separator ? 1 : 0) + nameLength + 1];
    if (out == nullptr) return nullptr;
    wmemcpy(out, path, pathLength);
    size_t at = pathLength;
    if (separator) out[at++] = utils::PathSeparator;
    wmemcpy(out + at, name, nameLength);
    out[at + nameLength] = 0;
    return out;
}
