// The drive list from fixture mount tables and automounter maps, and its
// pruning by file systems and exclude paths.
#include <gtest/gtest.h>

#include <cstring>
#include <cwchar>
#include <string>
#include <vector>

#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/mountlist.h"
#include "support/testsupport.h"

namespace {

// A temporary mount table and automounter master, installed for the life of
// the object.  The master file is missing unless written.
class SystemFiles {
public:
    SystemFiles() {
        MountTableManager::setMountTablePath(dir.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(dir.file("auto.master").c_str());
    }
    ~SystemFiles() {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
    }
    void table(const std::string& text) { dir.write("mtab", text); }
    void master(const std::string& text) { dir.write("auto.master", text); }
    testsupport::TempDir dir;
};

std::string narrow(const wchar_t* text) {
    std::string out;
    for (const wchar_t* p = text; p && *p; ++p) out += static_cast<char>(*p);
    return out;
}

// "name|type|fs" per drive, for compact comparisons.
std::vector<std::string> describe(const std::vector<DriveInfo>& drives) {
    std::vector<std::string> out;
    for (const DriveInfo& d : drives)
        out.push_back(narrow(d.getDriveName()) + "|" + std::to_string(d.getDriveType()) + "|" +
                      narrow(d.getDriveFileSystem()));
    return out;
}

std::vector<DriveInfo> build(unsigned int mask, DriveType assumed = dtAutoFS, unsigned int noAutoFS = 0) {
    DriveHelper helper;
    helper.setNoAutoFS(noAutoFS);
    helper.setAssumeAutoFSDriveType(assumed);
    std::vector<DriveInfo> drives;
    EXPECT_EQ(1, helper.buildDriveList(drives, mask));
    return drives;
}

typedef std::vector<std::string> Names;

}  // namespace

TEST(DriveList, DefaultAutomounterMasterIsEtcAutoMaster) {
    EXPECT_STREQ("/etc/auto.master", DriveHelper::getAutomounterMasterPath());
}

TEST(DriveList, NoTableAndNoMasterGiveEmptyListAndOne) {
    SystemFiles files;
    testsupport::TraceCapture capture;
    std::vector<DriveInfo> drives = build(31);
    EXPECT_TRUE(drives.empty());
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - unable to read automounter configuration ("))
        << capture.dump();
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - exit.\n"));
}

TEST(DriveList, RowsBecomeDrivesInTableOrder) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n"
                "/dev/sda2 /boot ext4 rw 0 0\n"
                "srv:/export/home /home nfs rw 0 0\n"
                "/dev/sdb1 /home/local xfs rw 0 0\n"
                "srv2:/x /home/local/remote nfs4 rw 0 0\n"
                "//pc/share /mnt/smb smbfs rw 0 0\n"
                "/dev/sdc1 /data cifs rw 0 0\n");
    EXPECT_EQ((Names{"/:|2|ext4", "/boot:|2|ext4", "/home:|4|nfs", "/home/local:|2|xfs",
                     "/home/local/remote:|4|nfs4", "/mnt/smb:|4|smbfs", "/data:|4|cifs"}),
              describe(build(31)));
}

TEST(DriveList, MaskKeepsOnlyMatchingKinds) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n"
                "srv:/export/home /home nfs rw 0 0\n");
    EXPECT_EQ((Names{"/home:|4|nfs"}), describe(build(4)));
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(build(2)));
    EXPECT_TRUE(build(0).empty());
}

TEST(DriveList, TwoRowsOnOneDirectoryMakeTwoDrives) {
    SystemFiles files;
    files.table("/dev/sda1 /srv ext4 rw 0 0\n"
                "srv:/x /srv nfs rw 0 0\n");
    EXPECT_EQ((Names{"/srv:|2|ext4", "/srv:|4|nfs"}), describe(build(31)));
}

TEST(DriveList, DirectoryEndingInColonGetsNoSecondColon) {
    SystemFiles files;
    files.table("/dev/sda1 /odd: ext4 rw 0 0\n");
    EXPECT_EQ((Names{"/odd:|2|ext4"}), describe(build(31)));
}

TEST(DriveList, DefaultAssumptionDropsAutofsButNetIsRemote) {
    SystemFiles files;
    std::string autoDir = files.dir.mkdirs("auto");
    files.table("/dev/sda1 / ext4 rw 0 0\n"
                "auto.home " + autoDir + " autofs rw 0 0\n"
                "-hosts /net autofs rw 0 0\n"
                "-hosts /smb autofs rw 0 0\n");
    testsupport::TraceCapture capture;
    EXPECT_EQ((Names{"/:|2|ext4", "/net:|4|autofs", "/smb:|4|autofs"}), describe(build(31)));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - accessing all mount paths\n"));
    EXPECT_EQ(2u, capture.count("accessToAllMountPaths - assuming '-hosts' drive to be remote"));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - drive: /net:, 4\n"));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - assuming /net to be 4\n"));
}

TEST(DriveList, AssumedLocalMakesProcALocalDrive) {
    SystemFiles files;
    files.table("proc /proc proc rw 0 0\n"
                "auto.misc /misc autofs rw 0 0\n");
    testsupport::TraceCapture capture;
    EXPECT_EQ((Names{"/proc:|2|proc", "/misc:|2|autofs"}), describe(build(31, dtLocal)));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - skipping accessing all mount paths\n"));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - assuming /proc to be 2\n"));
    EXPECT_FALSE(capture.contains("DriveHelper::buildDriveList - accessing all mount paths\n"));
}

TEST(DriveList, AssumedRemoteMakesAutofsRemoteButNetStaysRemote) {
    SystemFiles files;
    files.table("auto.misc /misc autofs rw 0 0\n"
                "-hosts /net autofs rw 0 0\n");
    EXPECT_EQ((Names{"/misc:|4|autofs", "/net:|4|autofs"}), describe(build(31, dtRemote)));
    // The mask test comes after the assumption.
    EXPECT_TRUE(build(2, dtRemote).empty());
}

TEST(DriveList, NoAutoFsSkipsTheAccessEvenWithDefaultAssumption) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n");
    testsupport::TraceCapture capture;
    build(31, dtAutoFS, 1);
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - skipping accessing all mount paths\n"));
}

TEST(DriveList, DfsMountAppearsTwiceRemoteFirst) {
    SystemFiles files;
    files.table("/dev/dfs0 /dfs dfs rw 0 0\n");
    EXPECT_EQ((Names{"/dfs:|4|dfs", "/dfs:|2|dfs"}), describe(build(31)));
}

TEST(DriveList, DfsMaskTestComesBeforeTheDoubling) {
    SystemFiles files;
    // A local dfs row passes mask 2, so both twins appear, the remote one too.
    files.table("/dev/dfs0 /dfs dfs rw 0 0\n");
    EXPECT_EQ((Names{"/dfs:|4|dfs", "/dfs:|2|dfs"}), describe(build(2)));
    // A remote dfs row fails mask 2, so neither twin appears.
    files.table("srv:/dfs /dfs dfs rw 0 0\n");
    EXPECT_TRUE(build(2).empty());
    EXPECT_EQ((Names{"/dfs:|4|dfs", "/dfs:|2|dfs"}), describe(build(4)));
}

TEST(DriveList, RootfsIsLocalWhateverWasAssumed) {
    SystemFiles files;
    files.table("rootfs / rootfs rw 0 0\n"
                "/dev/sda1 / ext4 rw 0 0\n");
    EXPECT_EQ((Names{"/:|2|rootfs", "/:|2|ext4"}), describe(build(31, dtRemote)));
    EXPECT_EQ((Names{"/:|2|rootfs", "/:|2|ext4"}), describe(build(31, dtLocal)));
    // A remote assumption fails mask 2 before the rootfs rule applies.
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(build(2, dtRemote)));
    // With no assumption the dummy rootfs yields nothing: the real row supplies "/".
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(build(31, dtAutoFS, 1)));
}

TEST(DriveList, RemoteAutomounterEntriesAreAppendedAsNfs) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n");
    files.dir.write("auto.misc",
                    "data server:/export/data\n"
                    "cd -fstype=iso9660 :/dev/cdrom\n");
    files.dir.write("auto.proj", "* server:/export/&\n");
    files.master("/misc auto.misc\n"
                 "/proj file:" + files.dir.file("auto.proj") + "\n"
                 "/net -hosts\n");
    testsupport::TraceCapture capture;
    EXPECT_EQ((Names{"/:|2|ext4", "/misc/data:|4|nfs", "/proj:|4|nfs"}), describe(build(31, dtAutoFS, 1)));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - inserted automounter mountpoint: '/misc/data'"))
        << capture.dump();
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - [:] [/misc/data] [nfs]\n"));
    // Remote entries are dropped by a local mask like any remote row.
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(build(2, dtAutoFS, 1)));
}

TEST(DriveList, BrokenMasterFileAddsNoAutomounterEntry) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n");
    files.dir.write("auto.misc", "data server:/export/data\n");
    // The first line is read and followed; the second ends the parse.
    files.master("/misc " + files.dir.file("auto.misc") + "\n"
                 "lonely\n");
    testsupport::TraceCapture capture;
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(build(31, dtAutoFS, 1)));
    EXPECT_TRUE(capture.contains("DriveHelper::buildDriveList - unable to read automounter configuration ("))
        << capture.dump();
}

TEST(DriveList, OddRowsNeverCrashTheBuilder) {
    SystemFiles files;
    std::string longDir = "/" + std::string(5000, 'x');
    files.table("lonely\n"
                "dev2 /only-dir\n"
                "/dev/sda1 " + longDir + " ext4 rw 0 0\n"
                "/dev/sda2 /with\\040space ext4 rw 0 0\n"
                "/dev/sda3 / xfs rw 0 0\n");
    std::vector<DriveInfo> drives = build(31, dtLocal);
    bool sawRoot = false, sawLong = false, sawSpace = false;
    for (const DriveInfo& d : drives) {
        ASSERT_NE(nullptr, d.getDriveName());
        if (wcscmp(d.getDriveName(), L"/:") == 0) sawRoot = true;
        // The system reader cuts a row at its line buffer; the cut
        // directory still makes a drive.
        if (wcslen(d.getDriveName()) > 4000) sawLong = true;
        if (wcscmp(d.getDriveName(), L"/with space:") == 0) sawSpace = true;
    }
    EXPECT_TRUE(sawRoot);
    EXPECT_TRUE(sawLong);
    EXPECT_TRUE(sawSpace);
}

TEST(DriveList, RealMountTableHoldsRoot) {
    DriveHelper helper;
    helper.setNoAutoFS(1);
    std::vector<DriveInfo> drives;
    ASSERT_EQ(1, helper.buildDriveList(drives, 31));
    bool sawRoot = false;
    for (const DriveInfo& d : drives)
        if (d.getDriveName() && wcscmp(d.getDriveName(), L"/:") == 0) sawRoot = true;
    EXPECT_TRUE(sawRoot) << drives.size() << " drives";
}

TEST(AccessToAllMountPaths, VisitsDummyMountsAndSkipsHostMaps) {
    SystemFiles files;
    std::string autoDir = files.dir.mkdirs("auto");
    files.dir.mkdirs("auto/a");
    files.dir.write("auto/b", "");
    files.table("/dev/sda1 / ext4 rw 0 0\n"
                "auto.home " + autoDir + " autofs rw 0 0\n"
                "auto.gone " + files.dir.file("gone") + " autofs rw 0 0\n"
                "-hosts /net autofs rw 0 0\n");
    testsupport::TraceCapture capture;
    accessToAllMountPaths();
    EXPECT_TRUE(capture.contains("accessToAllMountPaths - accessing path '" + autoDir + "' with special 'auto.home'"));
    EXPECT_TRUE(capture.contains("accessToAllMountPaths - accessing path '/net' with special '-hosts'"));
    EXPECT_EQ(1u, capture.count("accessToAllMountPaths - skipping - assuming remote"));
    // Only dummy rows are visited.
    EXPECT_FALSE(capture.contains("accessing path '/' with special"));
}

TEST(Pruning, IncludedFileSystemsKeepOnlyTheirDrivesIgnoringCase) {
    std::vector<DriveInfo> in{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs"),
                              DriveInfo(L"/boot:", dtLocal, L"xfs")};
    std::vector<DriveInfo> out;
    std::vector<FileSystemInfo> included{FileSystemInfo(L"EXT4"), FileSystemInfo(L"Xfs")};
    std::vector<FileSystemInfo> excluded;
    std::vector<PathInfo> paths;
    testsupport::TraceCapture capture;
    DriveHelper().fileSystemDriveListPruning(in, out, included, excluded, true, paths);
    EXPECT_EQ((Names{"/:|2|ext4", "/boot:|2|xfs"}), describe(out));
    EXPECT_TRUE(capture.contains(
        "DriveHelper::fileSystemDriveListPruning - drive '/home:' with 'nfs' fileSystem excluded!\n"));
    for (const DriveInfo& d : in) EXPECT_FALSE(d.getExcludedDrive());
}

TEST(Pruning, ExcludedFileSystemsDropTheirDrives) {
    std::vector<DriveInfo> in{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs")};
    std::vector<DriveInfo> out;
    std::vector<FileSystemInfo> included;
    std::vector<FileSystemInfo> excluded{FileSystemInfo(L"NFS")};
    std::vector<PathInfo> paths;
    DriveHelper().fileSystemDriveListPruning(in, out, included, excluded, true, paths);
    EXPECT_EQ((Names{"/:|2|ext4"}), describe(out));
    EXPECT_FALSE(in[1].getExcludedDrive());
}

TEST(Pruning, ExcludePathMarksDriveExcludedInInput) {
    std::vector<DriveInfo> in{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/mnt:", dtLocal, L"ext4"),
                              DriveInfo(L"/mnt/a:", dtLocal, L"ext4"), DriveInfo(L"/mnt2:", dtLocal, L"ext4")};
    std::vector<DriveInfo> out;
    std::vector<FileSystemInfo> none;
    std::vector<PathInfo> paths{PathInfo(L"/mnt/*", true)};
    DriveHelper().fileSystemDriveListPruning(in, out, none, none, true, paths);
    EXPECT_EQ((Names{"/:|2|ext4", "/mnt2:|2|ext4"}), describe(out));
    EXPECT_FALSE(in[0].getExcludedDrive());
    EXPECT_TRUE(in[1].getExcludedDrive());
    EXPECT_TRUE(in[2].getExcludedDrive());
    EXPECT_FALSE(in[3].getExcludedDrive());
}

TEST(Pruning, NonRecursiveExcludeCutsOnlyThatDrive) {
    std::vector<DriveInfo> in{DriveInfo(L"/mnt:", dtLocal, L"ext4"), DriveInfo(L"/mnt/a:", dtLocal, L"ext4")};
    std::vector<DriveInfo> out;
    std::vector<FileSystemInfo> none;
    std::vector<PathInfo> paths{PathInfo(L"/mnt/", false)};
    DriveHelper().fileSystemDriveListPruning(in, out, none, none, true, paths);
    EXPECT_EQ((Names{"/mnt/a:|2|ext4"}), describe(out));
}

TEST(Pruning, ExcludePathCaseFollowsTheQueryFlag) {
    std::vector<DriveInfo> in{DriveInfo(L"/Mnt:", dtLocal, L"ext4")};
    std::vector<FileSystemInfo> none;
    std::vector<PathInfo> paths{PathInfo(L"/mnt", true)};
    std::vector<DriveInfo> sensitive, insensitive;
    DriveHelper().fileSystemDriveListPruning(in, sensitive, none, none, true, paths);
    EXPECT_EQ(1u, sensitive.size());
    DriveHelper().fileSystemDriveListPruning(in, insensitive, none, none, false, paths);
    EXPECT_TRUE(insensitive.empty());
}

TEST(Pruning, ExcludeRootHasEmptyPatternThatMatchesAtTheFirstSeparator) {
    // "/" trims to the empty pattern; recursive, it covers every drive.
    std::vector<DriveInfo> in{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs")};
    std::vector<FileSystemInfo> none;
    std::vector<PathInfo> recursive{PathInfo(L"/", true)};
    std::vector<DriveInfo> out;
    DriveHelper().fileSystemDriveListPruning(in, out, none, none, true, recursive);
    EXPECT_TRUE(out.empty());
    EXPECT_TRUE(in[0].getExcludedDrive());
    EXPECT_TRUE(in[1].getExcludedDrive());
    // Not recursive, the empty pattern matches no drive name.
    std::vector<DriveInfo> in2{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs")};
    std::vector<PathInfo> flat{PathInfo(L"/", false)};
    std::vector<DriveInfo> out2;
    DriveHelper().fileSystemDriveListPruning(in2, out2, none, none, true, flat);
    EXPECT_EQ(2u, out2.size());
}

TEST(CheckDrive, FindsWholeDriveNamesOnly) {
    std::vector<DriveInfo> drives{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/usr/local:", dtLocal, L"ext4"),
                                  DriveInfo(L"/usr:", dtLocal, L"ext4"), DriveInfo(L"/usr:", dtRemote, L"nfs")};
    DriveHelper helper;
    EXPECT_EQ(2, helper.checkDrive(drives, L"/usr:", true));
    EXPECT_EQ(0, helper.checkDrive(drives, L"/:", true));
    EXPECT_EQ(1, helper.checkDrive(drives, L"/usr/local:", true));
    EXPECT_EQ(-1, helper.checkDrive(drives, L"/usr", true));
    EXPECT_EQ(-1, helper.checkDrive(drives, L"/opt:", true));
    EXPECT_EQ(-1, helper.checkDrive(drives, L"/USR:", true));
    EXPECT_EQ(2, helper.checkDrive(drives, L"/USR:", false));
    EXPECT_EQ(-1, helper.checkDrive(std::vector<DriveInfo>(), L"/:", true));
}

TEST(CheckFileSystems, ComparesByCaseFlag) {
    std::vector<FileSystemInfo> list{FileSystemInfo(L"nfs"), FileSystemInfo(L"Ext4")};
    EXPECT_TRUE(checkFileSystems(L"nfs", list, true));
    EXPECT_FALSE(checkFileSystems(L"ext4", list, true));
    EXPECT_TRUE(checkFileSystems(L"ext4", list, false));
    EXPECT_FALSE(checkFileSystems(L"xfs", list, false));
    std::vector<FileSystemInfo> empty;
    EXPECT_FALSE(checkFileSystems(L"nfs", empty, false));
}

TEST(GetDriverType, LastMatchingRealRowDecides) {
    SystemFiles files;
    files.table("/dev/sda1 / ext4 rw 0 0\n"
                "srv:/x /home nfs rw 0 0\n"
                "/dev/sdb1 /srv ext4 rw 0 0\n"
                "srv:/y /srv nfs rw 0 0\n"
                "/dev/sdc1 /data xfs rw 0 0\n"
                "auto.data /data autofs rw 0 0\n");
    DriveHelper helper;
    EXPECT_EQ(dtLocal, helper.getDriverType(const_cast<wchar_t*>(L"/")));
    EXPECT_EQ(dtRemote, helper.getDriverType(const_cast<wchar_t*>(L"/home")));
    EXPECT_EQ(dtRemote, helper.getDriverType(const_cast<wchar_t*>(L"/srv")));
    EXPECT_EQ(dtLocal, helper.getDriverType(const_cast<wchar_t*>(L"/data")));
    EXPECT_EQ(dtUnknown, helper.getDriverType(const_cast<wchar_t*>(L"/nothing")));
    EXPECT_EQ(dtUnknown, helper.getDriverType(const_cast<wchar_t*>(L"/home:")));
}
