// Mount table rows and the dummy / remote rules.
#include <gtest/gtest.h>

#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/mountlist.h"
#include "support/testsupport.h"

namespace {

// Points the reader at a fixture table for the life of the object.
class MountTableFixture {
public:
    explicit MountTableFixture(const std::string& path) { MountTableManager::setMountTablePath(path.c_str()); }
    ~MountTableFixture() { MountTableManager::setMountTablePath(nullptr); }
};

bool dummy(const char* type) { return MountTableManager::isDummyFileSystem(const_cast<char*>(type)); }

bool remote(const char* dev, const char* type) {
    return MountTableManager::isRemoteFileSystem(const_cast<char*>(dev), const_cast<char*>(type));
}

}  // namespace

TEST(MountEntry, NewEntryIsAllZero) {
    MountEntry entry;
    EXPECT_EQ(nullptr, entry.getDevName());
    EXPECT_EQ(nullptr, entry.getMountDir());
    EXPECT_EQ(nullptr, entry.getFileSystemType());
    EXPECT_FALSE(entry.isDummy());
    EXPECT_FALSE(entry.isRemote());
}

TEST(MountEntry, CopyConstructorCopiesAllFiveFieldsDeeply) {
    MountEntry entry;
    entry.setDevName("srv:/export");
    entry.setMountDir("/mnt/export");
    entry.setFileSystemType("nfs");
    entry.setDummy(true);
    entry.setRemote(true);
    MountEntry copy(entry);
    entry.setMountDir("/elsewhere");
    EXPECT_STREQ("srv:/export", copy.getDevName());
    EXPECT_STREQ("/mnt/export", copy.getMountDir());
    EXPECT_STREQ("nfs", copy.getFileSystemType());
    EXPECT_TRUE(copy.isDummy());
    EXPECT_TRUE(copy.isRemote());
    EXPECT_NE(copy.getDevName(), entry.getDevName());
}

TEST(MountEntry, SettersReplaceTextAndFreeEntryValuesClearsAll) {
    MountEntry entry;
    entry.setDevName("a");
    entry.setDevName("bb");
    entry.setDevName(entry.getDevName());  // setting its own text keeps it
    EXPECT_STREQ("bb", entry.getDevName());
    entry.setMountDir("/x");
    entry.setFileSystemType("ext4");
    entry.freeEntryValues();
    EXPECT_EQ(nullptr, entry.getDevName());
    EXPECT_EQ(nullptr, entry.getMountDir());
    EXPECT_EQ(nullptr, entry.getFileSystemType());
}

TEST(MountTableManager, ThirteenPseudoFileSystemsAreDummy) {
    const char* names[] = {"autofs", "ignore",  "devfs",   "devpts",     "fdesc",  "proc",  "procfs",
                           "sysfs",  "debugfs", "fusectl", "securityfs", "secfs2", "rootfs"};
    for (const char* name : names) EXPECT_TRUE(dummy(name)) << name;
}

TEST(MountTableManager, DummyTestIsExact) {
    EXPECT_FALSE(dummy("ext4"));
    EXPECT_FALSE(dummy("autofs2"));
    EXPECT_FALSE(dummy("Proc"));
    EXPECT_FALSE(dummy("tmpfs"));
    EXPECT_FALSE(dummy(""));
    EXPECT_FALSE(dummy(nullptr));
}

TEST(MountTableManager, DummyTestTracesTypeAndAnswer) {
    testsupport::TraceCapture capture;
    dummy("proc");
    EXPECT_TRUE(capture.contains("MountTableManager::isDummyFileSystem - fileSystemType: 'proc' is dummy: 'true'"))
        << capture.dump();
}

TEST(MountTableManager, NfsPrefixIsRemoteButNotInfix) {
    EXPECT_TRUE(remote("/dev/sda1", "nfsd"));
    EXPECT_TRUE(remote("/dev/sda1", "nfs"));
    EXPECT_TRUE(remote("/dev/sda1", "nfs4"));
    EXPECT_TRUE(remote("/dev/sda1", "gpfs2"));
    EXPECT_FALSE(remote("/dev/sda1", "xnfs"));
    EXPECT_FALSE(remote("/dev/sda1", "xgpfs"));
}

TEST(MountTableManager, DeviceWithColonIsRemoteUnderAnyType) {
    EXPECT_TRUE(remote("srv:/export", "ext4"));
    EXPECT_TRUE(remote("srv:/export", "xfs"));
    EXPECT_TRUE(remote("srv:/export", ""));
}

TEST(MountTableManager, SmbfsNeedsDoubleSlashDevice) {
    EXPECT_TRUE(remote("//server/share", "smbfs"));
    EXPECT_FALSE(remote("/server/share", "smbfs"));
    EXPECT_FALSE(remote("//server/share", "ext4"));
}

TEST(MountTableManager, ExactRemoteTypes) {
    EXPECT_TRUE(remote("x", "ncpfs"));
    EXPECT_TRUE(remote("x", "cifs"));
    EXPECT_TRUE(remote("x", "mvfs"));
    EXPECT_FALSE(remote("x", "cifs2"));
    EXPECT_FALSE(remote("x", "mvfs2"));
    EXPECT_FALSE(remote("/dev/sda1", "ext4"));
    EXPECT_FALSE(remote(nullptr, nullptr));
}

TEST(MountTableManager, HostListedTypeIsRemote) {
    EXPECT_FALSE(remote("/dev/sdb", "lustre"));
    MountTableManager::remoteFileSystems.push_back("lustre");
    EXPECT_TRUE(remote("/dev/sdb", "lustre"));
    MountTableManager::remoteFileSystems.clear();
    EXPECT_FALSE(remote("/dev/sdb", "lustre"));
}

TEST(MountTableManager, DefaultTableIsEtcMtab) {
    EXPECT_STREQ("/etc/mtab", MountTableManager::getMountTablePath());
    MountTableManager::setMountTablePath("/tmp/x");
    EXPECT_STREQ("/tmp/x", MountTableManager::getMountTablePath());
    MountTableManager::setMountTablePath(nullptr);
    EXPECT_STREQ("/etc/mtab", MountTableManager::getMountTablePath());
}

TEST(MountTableManager, ReadsRowsInTableOrderWithFlags) {
    testsupport::TempDir dir;
    std::string table = dir.write("mtab",
                                  "/dev/sda1 / ext4 rw 0 0\n"
                                  "proc /proc proc rw 0 0\n"
                                  "srv:/export /home nfs rw 0 0\n"
                                  "auto.net /net autofs rw 0 0\n"
                                  "/dev/sda2 /boot ext4 rw 0 0\n");
    MountTableFixture fixture(table);
    std::vector<MountEntry> list;
    testsupport::TraceCapture capture;
    ASSERT_TRUE(MountTableManager::getMountEntryList(list));
    ASSERT_EQ(5u, list.size());
    EXPECT_STREQ("/dev/sda1", list[0].getDevName());
    EXPECT_STREQ("/", list[0].getMountDir());
    EXPECT_STREQ("ext4", list[0].getFileSystemType());
    EXPECT_FALSE(list[0].isDummy());
    EXPECT_FALSE(list[0].isRemote());
    EXPECT_STREQ("/proc", list[1].getMountDir());
    EXPECT_TRUE(list[1].isDummy());
    EXPECT_FALSE(list[1].isRemote());
    EXPECT_STREQ("/home", list[2].getMountDir());
    EXPECT_TRUE(list[2].isRemote());
    EXPECT_FALSE(list[2].isDummy());
    EXPECT_STREQ("/net", list[3].getMountDir());
    EXPECT_TRUE(list[3].isDummy());
    EXPECT_STREQ("/boot", list[4].getMountDir());
    EXPECT_TRUE(capture.contains("MountTableManager::getMountEntryList - MOUNTED_GETMNTENT1 defined!\n"));
    EXPECT_TRUE(capture.contains("MountTableManager::getMountEntryList - mountEntryList size is 5!\n"));
    EXPECT_TRUE(capture.contains("MountTableManager::getMountEntryList - exiting with retValue = true!\n"));
}

TEST(MountTableManager, AppendsBehindExistingEntries) {
    testsupport::TempDir dir;
    MountTableFixture fixture(dir.write("mtab", "/dev/sda1 / ext4 rw 0 0\n"));
    std::vector<MountEntry> list(1);
    list[0].setMountDir("/old");
    ASSERT_TRUE(MountTableManager::getMountEntryList(list));
    ASSERT_EQ(2u, list.size());
    EXPECT_STREQ("/old", list[0].getMountDir());
    EXPECT_STREQ("/", list[1].getMountDir());
}

TEST(MountTableManager, OctalEscapesAreDecoded) {
    testsupport::TempDir dir;
    MountTableFixture fixture(dir.write("mtab", "/dev/sdb1 /media/my\\040disk vfat rw 0 0\n"));
    std::vector<MountEntry> list;
    ASSERT_TRUE(MountTableManager::getMountEntryList(list));
    ASSERT_EQ(1u, list.size());
    EXPECT_STREQ("/media/my disk", list[0].getMountDir());
}

TEST(MountTableManager, UnopenableTableGivesFalseAndLeavesListAlone) {
    testsupport::TempDir dir;
    MountTableFixture fixture(dir.file("missing-mtab"));
    std::vector<MountEntry> list(1);
    testsupport::TraceCapture capture;
    EXPECT_FALSE(MountTableManager::getMountEntryList(list));
    EXPECT_EQ(1u, list.size());
    EXPECT_TRUE(capture.contains("MountTableManager::getMountEntryList - exiting with retValue = false!\n"));
}

TEST(MountTableManager, OddRowsNeverCrashTheReader) {
    testsupport::TempDir dir;
    std::string longDir = "/" + std::string(6000, 'd');
    MountTableFixture fixture(dir.write("mtab",
                                        "lonely\n"
                                        "dev2 /only-dir\n"
                                        "\n"
                                        "# comment\n"
                                        "/dev/sda1 " + longDir + " ext4 rw 0 0\n"
                                        "/dev/sda3 / xfs rw 0 0\n"));
    std::vector<MountEntry> list;
    MountTableManager::getMountEntryList(list);
    bool sawRoot = false;
    for (const MountEntry& entry : list) {
        ASSERT_NE(nullptr, entry.getDevName());
        ASSERT_NE(nullptr, entry.getMountDir());
        ASSERT_NE(nullptr, entry.getFileSystemType());
        if (strcmp(entry.getMountDir(), "/") == 0 && strcmp(entry.getFileSystemType(), "xfs") == 0) sawRoot = true;
    }
    EXPECT_TRUE(sawRoot);
}
