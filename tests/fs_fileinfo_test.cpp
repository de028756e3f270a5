// FsFileInfo and the small value records: defaults, deep copies, the lazy
// lstat fill, compare, and the deliberate copy rules of DriveInfo.
#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <cwchar>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/utils.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

std::wstring wide(const std::string& text) {
    wchar_t* w = utils::myMbsToWcsString(text.c_str());
    std::wstring out(w);
    delete[] w;
    return out;
}

}  // namespace

TEST(FsFileInfo, NewRecordHasZeroFieldsAndTextZeroChecksums) {
    FsFileInfo info;
    EXPECT_EQ(info.getPath(), nullptr);
    EXPECT_EQ(info.getName(), nullptr);
    ASSERT_NE(info.getMD5(), nullptr);
    ASSERT_NE(info.getSHA256(), nullptr);
    EXPECT_STREQ(info.getMD5(), L"0");
    EXPECT_STREQ(info.getSHA256(), L"0");
    EXPECT_EQ(info.getValidMask(), 0u);
    EXPECT_FALSE(info.getStatFailed());
    EXPECT_EQ(info.getCRC32(), 0u);
    EXPECT_EQ(info.getQ32(), 0u);
}

TEST(FsFileInfo, LazyGetterWithoutPathTouchesNothingAndReturnsZero) {
    TraceCapture capture;
    FsFileInfo info;
    EXPECT_EQ(info.getAttr(), 0u);
    EXPECT_EQ(info.getSize(), 0ull);
    EXPECT_FALSE(info.getStatFailed());
    EXPECT_FALSE(info.updateInfo());
    EXPECT_FALSE(capture.contains("lstat"));
}

TEST(FsFileInfo, SettersSetTheirValidityBits) {
    FsFileInfo info;
    info.setFileAttr(0x2000);
    info.setFileSize(12);
    info.setCreateTime(3);
    info.setLastAccessTime(4);
    info.setLastModifyTime(5);
    info.setCRC32(6);
    info.setQ32(7);
    EXPECT_EQ(info.getValidMask(), 0x1u | 0x2u | 0x80u | 0x40u | 0x100u | 0x400u | 0x800u);
    EXPECT_EQ(info.getCRC32(), 6u);
    EXPECT_EQ(info.getQ32(), 7u);
}

TEST(FsFileInfo, MD5SetterMayStoreNull) {
    FsFileInfo info;
    info.setMD5(nullptr);
    info.setSHA256(nullptr);
    EXPECT_EQ(info.getMD5(), nullptr);
    EXPECT_EQ(info.getSHA256(), nullptr);
    FsFileInfo copy(info);
    EXPECT_EQ(copy.getMD5(), nullptr);
    info.clear();
    EXPECT_STREQ(info.getMD5(), L"0");
}

TEST(FsFileInfo, GetSizeFromSetterSkipsFileSystemWhileGetAttrStatsIt) {
    TempDir dir;
    dir.write("f.bin", "12345");
    FsFileInfo info;
    info.setFilePath(wide(dir.path()).c_str());
    info.setFileName(L"f.bin");
    info.setFileSize(99);
    TraceCapture capture;
    // Remove the file: a size from the setter needs no access at all.
    ASSERT_EQ(unlink(dir.file("f.bin").c_str()), 0);
    EXPECT_EQ(info.getSize(), 99ull);
    EXPECT_FALSE(info.getStatFailed());
    EXPECT_EQ(capture.count("lstat(...) failed"), 0u);
    // getAttr has no value yet and tries the file.
    EXPECT_EQ(info.getAttr(), 0u);
    EXPECT_TRUE(info.getStatFailed());
    EXPECT_EQ(capture.count("FsFileInfo::updateInfo - lstat(...) failed on '"), 1u);
}

TEST(FsFileInfo, SetterValueIsNeverOverwrittenByTheFill) {
    TempDir dir;
    dir.write("f.bin", "12345");
    FsFileInfo info;
    info.setFilePath(wide(dir.path()).c_str());
    info.setFileName(L"f.bin");
    info.setFileSize(99);
    EXPECT_EQ(info.getAttr() & 0x2000u, 0x2000u);
    EXPECT_EQ(info.getSize(), 99ull);
    EXPECT_EQ(info.getValidMask() & 0x3ffu, 0x3ffu);
}

TEST(FsFileInfo, UpdateInfoFillsEveryStatField) {
    TempDir dir;
    std::string file = dir.write("f.txt", "hello");
    ASSERT_EQ(chmod(file.c_str(), 0640), 0);
    struct stat st;
    ASSERT_EQ(lstat(file.c_str(), &st), 0);
    FsFileInfo info;
    info.setFilePath(wide(dir.path() + "/").c_str());
    info.setFileName(L"f.txt");
    EXPECT_TRUE(info.updateInfo());
    EXPECT_EQ(info.getValidMask(), 0x3ffu);
    EXPECT_EQ(info.getAttr(), 0x2000u | 0x2u | 0x4u | 0x10u);
    EXPECT_EQ(info.getSize(), 5ull);
    EXPECT_EQ(info.getDevice(), static_cast<unsigned int>(st.st_dev));
    EXPECT_EQ(info.getINode(), static_cast<unsigned int>(st.st_ino));
    EXPECT_EQ(info.getUserId(), static_cast<unsigned int>(st.st_uid));
    EXPECT_EQ(info.getGroupId(), static_cast<unsigned int>(st.st_gid));
    EXPECT_EQ(info.getLastModifyTime(), static_cast<long>(st.st_mtime));
    EXPECT_EQ(info.getLastAccessTime(), static_cast<long>(st.st_atime));
    EXPECT_EQ(info.getCreateTime(), static_cast<long>(st.st_ctime));
    EXPECT_EQ(info.getLinkCount(), 1u);
    EXPECT_EQ(info.getCRC32(), 0u);
    EXPECT_EQ(info.getValidMask() & 0xc00u, 0u);
}

TEST(FsFileInfo, DirectoryAndSymbolicLinkBits) {
    TempDir dir;
    dir.mkdirs("sub");
    ASSERT_EQ(chmod(dir.file("sub").c_str(), 0751), 0);
    ASSERT_EQ(symlink("sub", dir.file("link").c_str()), 0);
    FsFileInfo d;
    d.setFilePath(wide(dir.path()).c_str());
    d.setFileName(L"sub");
    EXPECT_EQ(d.getAttr(), 0x1u | 0x2u | 0x4u | 0x8u | 0x10u | 0x40u | 0x200u);
    FsFileInfo l;
    l.setFilePath(wide(dir.path()).c_str());
    l.setFileName(L"link");
    EXPECT_EQ(l.getAttr() & 0x3001u, 0x1000u);
}

TEST(FsFileInfo, CharacterDeviceBitAndPipeWithoutTypeBit) {
    FsFileInfo null;
    null.setFilePath(L"/dev");
    null.setFileName(L"null");
    EXPECT_EQ(null.getAttr() & 0x7001u, 0x4000u);
    TempDir dir;
    ASSERT_EQ(mkfifo(dir.file("pipe").c_str(), 0600), 0);
    FsFileInfo pipe;
    pipe.setFilePath(wide(dir.path()).c_str());
    pipe.setFileName(L"pipe");
    EXPECT_TRUE(pipe.updateInfo());
    EXPECT_EQ(pipe.getAttr() & 0x7001u, 0u);
    EXPECT_EQ(pipe.getAttr(), 0x2u | 0x4u);
}

TEST(FsFileInfo, RecordOfVanishedFileGivesZeroAndSetsStatFailedAtEachCall) {
    TempDir dir;
    FsFileInfo info;
    info.setFilePath(wide(dir.path()).c_str());
    info.setFileName(L"gone");
    TraceCapture capture;
    EXPECT_EQ(info.getAttr(), 0u);
    EXPECT_EQ(info.getSize(), 0ull);
    EXPECT_EQ(info.getGroupId(), 0u);
    EXPECT_EQ(info.getUserId(), 0u);
    EXPECT_EQ(info.getINode(), 0u);
    EXPECT_EQ(info.getLastAccessTime(), 0);
    EXPECT_EQ(info.getCreateTime(), 0);
    EXPECT_EQ(info.getLastModifyTime(), 0);
    EXPECT_TRUE(info.getStatFailed());
    EXPECT_EQ(info.getValidMask(), 0u);
    EXPECT_EQ(capture.count("lstat(...) failed"), 8u);
    // statFailed travels with a copy but is never consulted: the copy retries.
    FsFileInfo copy(info);
    EXPECT_TRUE(copy.getStatFailed());
    dir.write("gone", "now here");
    EXPECT_EQ(copy.getSize(), 8ull);
}

TEST(FsFileInfo, CopiesAreIndependent) {
    FsFileInfo source;
    source.setFilePath(L"/a");
    source.setFileName(L"one");
    source.setFileSize(5);
    source.setCRC32(0xdeadbeef);
    FsFileInfo copy(source);
    copy.setFileName(L"two");
    EXPECT_STREQ(source.getName(), L"one");
    EXPECT_STREQ(copy.getName(), L"two");
    EXPECT_NE(copy.getPath(), source.getPath());
    EXPECT_STREQ(copy.getPath(), L"/a");
    EXPECT_EQ(copy.getValidMask(), source.getValidMask());
    EXPECT_EQ(copy.getCRC32(), 0xdeadbeefu);

    FsFileInfo assigned;
    assigned.setFileName(L"old");
    assigned = source;
    assigned.setFilePath(L"/b");
    EXPECT_STREQ(source.getPath(), L"/a");
    EXPECT_STREQ(assigned.getName(), L"one");
    assigned = assigned;
    EXPECT_STREQ(assigned.getName(), L"one");
}

TEST(FsFileInfo, ClearRestoresNewState) {
    FsFileInfo info;
    info.setFilePath(L"/a");
    info.setFileName(L"b");
    info.setMD5(L"abc");
    info.setFileSize(3);
    info.clear();
    EXPECT_EQ(info.getPath(), nullptr);
    EXPECT_EQ(info.getName(), nullptr);
    EXPECT_STREQ(info.getMD5(), L"0");
    EXPECT_EQ(info.getValidMask(), 0u);
}

TEST(FsFileInfo, CompareByPathNameFullPathAndSize) {
    FsFileInfo left;
    left.setFilePath(L"/dir");
    left.setFileName(L"Alpha");
    left.setFileSize(10);
    FsFileInfo right;
    right.setFilePath(L"/dir");
    right.setFileName(L"alpha");
    right.setFileSize(20);
    // 0 ==, 1 >=, 2 <=, 3 >, 4 <, 5 !=
    EXPECT_TRUE(left.compare(right, 1, 0, true));
    EXPECT_FALSE(left.compare(right, 2, 0, true));
    EXPECT_TRUE(left.compare(right, 2, 0, false));
    EXPECT_TRUE(left.compare(right, 2, 5, true));
    EXPECT_TRUE(left.compare(right, 3, 0, false));
    EXPECT_FALSE(left.compare(right, 3, 0, true));
    EXPECT_TRUE(left.compare(right, 4, 4, true));
    EXPECT_FALSE(left.compare(right, 4, 3, true));
    EXPECT_TRUE(right.compare(left, 4, 1, true));
    EXPECT_FALSE(left.compare(right, 7, 0, true));
    EXPECT_FALSE(left.compare(right, 0, 0, true));
}

TEST(FsFileInfo, CompareSizeReadsFieldWithoutLazyFill) {
    TempDir dir;
    dir.write("f", "123");
    FsFileInfo left;
    left.setFilePath(wide(dir.path()).c_str());
    left.setFileName(L"f");
    FsFileInfo right;
    right.setFileSize(0);
    EXPECT_TRUE(left.compare(right, 4, 0, true));
    EXPECT_EQ(left.getValidMask(), 0u);
}

TEST(PathInfo, ConstructionCopiesAndNullStaysNull) {
    wchar_t buffer[] = L"/x";
    PathInfo a(buffer, true);
    buffer[1] = L'y';
    EXPECT_STREQ(a.getPathName(), L"/x");
    EXPECT_TRUE(a.getRecursive());
    PathInfo n(nullptr, false);
    EXPECT_EQ(n.getPathName(), nullptr);
    PathInfo d;
    EXPECT_EQ(d.getPathName(), nullptr);
    EXPECT_FALSE(d.getRecursive());
}

TEST(PathInfo, EqualityAndOrdering) {
    PathInfo a(L"/a", true);
    PathInfo a2(L"/a", true);
    PathInfo aFlat(L"/a", false);
    PathInfo b(L"/b", true);
    PathInfo none1;
    PathInfo none2;
    EXPECT_TRUE(a == a2);
    EXPECT_FALSE(a == aFlat);
    EXPECT_TRUE(none1 == none2);
    EXPECT_FALSE(none1 == a);
    EXPECT_FALSE(a == none1);
    EXPECT_TRUE(a < b);
    EXPECT_FALSE(b < a);
    EXPECT_FALSE(a < aFlat);
}

TEST(PathInfo, AssignmentCopiesBothFields) {
    PathInfo a(L"/a", true);
    PathInfo b(L"/b", false);
    b = a;
    EXPECT_STREQ(b.getPathName(), L"/a");
    EXPECT_TRUE(b.getRecursive());
    EXPECT_NE(b.getPathName(), a.getPathName());
    PathInfo c;
    c.setPathInfo(PathInfo(nullptr, true));
    EXPECT_EQ(c.getPathName(), nullptr);
    EXPECT_TRUE(c.getRecursive());
}

TEST(DriveInfo, AssignmentLeavesTargetsExcludedFlagWhileCopyConstructorCarriesIt) {
    DriveInfo source(L"/usr:", dtLocal, L"ext4");
    source.setExcludedDrive(true);
    DriveInfo target(L"/:", dtRemote, L"nfs");
    target = source;
    EXPECT_FALSE(target.getExcludedDrive());
    EXPECT_STREQ(target.getDriveName(), L"/usr:");
    EXPECT_STREQ(target.getDriveFileSystem(), L"ext4");
    EXPECT_EQ(target.getDriveType(), dtLocal);
    DriveInfo copied(source);
    EXPECT_TRUE(copied.getExcludedDrive());

    DriveInfo flagged(L"/a:", dtLocal, L"xfs");
    flagged.setExcludedDrive(true);
    flagged.setDriveInfo(DriveInfo(L"/b:", dtRemote, L"nfs"));
    EXPECT_TRUE(flagged.getExcludedDrive());
}

TEST(DriveInfo, SetDriveInfoWithANullSourceStringNullsBothAndCopiesType) {
    DriveInfo target(L"/usr:", dtLocal, L"ext4");
    DriveInfo source(L"/x:", dtRemote, nullptr);
    target.setDriveInfo(source);
    EXPECT_EQ(target.getDriveName(), nullptr);
    EXPECT_EQ(target.getDriveFileSystem(), nullptr);
    EXPECT_EQ(target.getDriveType(), dtRemote);
}

TEST(DriveInfo, EqualityIgnoresExcludedFlag) {
    DriveInfo a(L"/:", dtLocal, L"ext4");
    DriveInfo b(L"/:", dtLocal, L"ext4");
    b.setExcludedDrive(true);
    EXPECT_TRUE(a == b);
    EXPECT_FALSE(a == DriveInfo(L"/:", dtRemote, L"ext4"));
    EXPECT_FALSE(a == DriveInfo(L"/:", dtLocal, L"xfs"));
    EXPECT_FALSE(a == DriveInfo(L"/usr:", dtLocal, L"ext4"));
}

TEST(DriveType, ValuesAndGroupMasks) {
    EXPECT_EQ(dtUnknown, 0);
    EXPECT_EQ(dtReserved1, 1);
    EXPECT_EQ(dtLocal, 2);
    EXPECT_EQ(dtRemote, 4);
    EXPECT_EQ(dtReserved8, 8);
    EXPECT_EQ(dtReserved16, 16);
    EXPECT_EQ(dtAutoFS, 32);
    EXPECT_EQ(mdAllDrives, 0x1f);
    EXPECT_EQ(mdLocalDriveGroup, 0x1b);
    EXPECT_EQ(mdRemoteDriveGroup, 4);
    EXPECT_EQ(mdOtherDriveGroup, 0);
    EXPECT_EQ(dtAutoFS & mdAllDrives, 0);
    EXPECT_EQ(dtRemote & mdLocalDriveGroup, 0);
}

TEST(PathDrive, CopiesAlwaysStartWithExcludedDriveFalse) {
    DriveInfo drive(L"/data:", dtLocal, L"ext4");
    drive.setExcludedDrive(true);
    PathDrive pd(L"/data/x", true, drive);
    EXPECT_FALSE(pd.getExcludedDrive());
    pd.setExcludedDrive(true);
    PathDrive copy(pd);
    EXPECT_FALSE(copy.getExcludedDrive());
    EXPECT_STREQ(copy.getPathName(), L"/data/x");
    EXPECT_TRUE(copy.getRecursive());
    EXPECT_STREQ(copy.getDriveName(), L"/data:");
    EXPECT_STREQ(copy.second.getDriveFileSystem(), L"ext4");
    EXPECT_STREQ(copy.first.getPathName(), L"/data/x");
    PathDrive assigned;
    assigned = pd;
    EXPECT_FALSE(assigned.getExcludedDrive());
    EXPECT_TRUE(assigned == pd);
    // Passed where a PathInfo is read.
    const PathInfo& asPath = assigned;
    EXPECT_STREQ(asPath.getPathName(), L"/data/x");
    std::vector<PathDrive> list;
    list.push_back(pd);
    list.push_back(assigned);
    EXPECT_STREQ(list[1].first.getPathName(), L"/data/x");
}

TEST(FileSystemInfo, CopyAssignAndEquality) {
    FileSystemInfo nfs(L"nfs");
    FileSystemInfo copy(nfs);
    EXPECT_STREQ(copy.getFileSystemName(), L"nfs");
    EXPECT_NE(copy.getFileSystemName(), nfs.getFileSystemName());
    FileSystemInfo other(L"dfs");
    other = nfs;
    EXPECT_TRUE(other == nfs);
    EXPECT_FALSE(FileSystemInfo(L"dfs") == nfs);
    FileSystemInfo empty;
    EXPECT_EQ(empty.getFileSystemName(), nullptr);
    EXPECT_FALSE(empty == nfs);
}

#include "fscanner/fs/fs_serializer.h"

namespace {

// Hands out a path, a name, two checksum texts and a validMask of 0, as a
// stored record without any scalar would read.
class StoredRecord : public FsSerializator {
public:
    explicit StoredRecord(std::vector<std::wstring> texts) : strings(texts) {}
    bool saveString(wchar_t const*) override { return false; }
    bool saveInteger32(int) override { return false; }
    bool saveUnsigned32(unsigned int) override { return false; }
    bool saveUnsigned64(unsigned long long) override { return false; }
    wchar_t* loadString() override {
        if (next >= strings.size()) return nullptr;
        return FsFileInfo::duplicateString(strings[next++].c_str());
    }
    int loadInteger32() override { return 0; }
    unsigned int loadUnsigned32() override { return 0; }
    unsigned long long loadUnsigned64() override { return 0; }
    int getLastError() override { return 0; }
    void reset() override {}

private:
    std::vector<std::wstring> strings;
    size_t next = 0;
};

}  // namespace

TEST(FsFileInfo, LoadedRecordOfVanishedPathGivesZeroFromEveryLazyGetter) {
    TempDir dir;
    StoredRecord stored({wide(dir.path()), L"was-here", L"0", L"0"});
    FsFileInfo info;
    info.setFileSize(5);
    ASSERT_EQ(info.loadObject(stored), 0);
    EXPECT_EQ(info.getValidMask(), 0u);
    EXPECT_STREQ(info.getName(), L"was-here");
    TraceCapture capture;
    EXPECT_EQ(info.getSize(), 0ull);
    EXPECT_TRUE(info.getStatFailed());
    EXPECT_EQ(info.getAttr(), 0u);
    EXPECT_EQ(info.getLastModifyTime(), 0);
    EXPECT_EQ(info.getUserId(), 0u);
    EXPECT_EQ(capture.count("lstat(...) failed"), 4u);
    EXPECT_EQ(info.getValidMask(), 0u);
}
