// Waking the automounter before the drive list is read: every dummy row of
// the mount table is traced, but only where a look-up can reach the
// automounter are its directories listed and looked into; a kernel pseudo
// file system such as proc is left alone.  Whether a directory was listed is
// seen through inotify, which reports the opening of a watched directory.
#include <gtest/gtest.h>

#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <map>
#include <string>

#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/mountlist.h"
#include "support/testsupport.h"

namespace {

class Tables {
public:
    Tables() {
        MountTableManager::setMountTablePath(dir.file("mtab").c_str());
        DriveHelper::setAutomounterMasterPath(dir.file("auto.master").c_str());
    }
    ~Tables() {
        MountTableManager::setMountTablePath(nullptr);
        DriveHelper::setAutomounterMasterPath(nullptr);
    }
    testsupport::TempDir dir;
};

// Directories opened while it watched them, by watch.
class OpenWatch {
public:
    OpenWatch() : fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC)) {}
    ~OpenWatch() {
        if (fd >= 0) close(fd);
    }
    bool usable() const { return fd >= 0; }
    int watch(const std::string& path) { return inotify_add_watch(fd, path.c_str(), IN_OPEN); }
    std::map<int, int> opened() {
        std::map<int, int> count;
        alignas(inotify_event) char buffer[4096];
        for (;;) {
            ssize_t n = read(fd, buffer, sizeof buffer);
            if (n <= 0) break;
            for (char* p = buffer; p < buffer + n;) {
                inotify_event* event = reinterpret_cast<inotify_event*>(p);
                if ((event->mask & IN_OPEN) != 0 && event->len == 0) ++count[event->wd];
                p += sizeof(inotify_event) + event->len;
            }
        }
        return count;
    }

private:
    int fd;
};

}  // namespace

TEST(AutomountWakeup, ListsAutomounterDirectoriesAndLeavesKernelPseudoFileSystemsAlone) {
    Tables tables;
    std::string autoDir = tables.dir.mkdirs("auto");
    tables.dir.mkdirs("auto/key");
    std::string procDir = tables.dir.mkdirs("proc");
    tables.dir.mkdirs("proc/1");
    std::string sysDir = tables.dir.mkdirs("sys");
    tables.dir.mkdirs("sys/kernel");
    tables.dir.write("mtab", "/dev/sda1 / ext4 rw 0 0\n"
                             "auto.home " + autoDir + " autofs rw 0 0\n"
                             "proc " + procDir + " proc rw 0 0\n"
                             "sysfs " + sysDir + " sysfs rw 0 0\n");
    OpenWatch watch;
    if (!watch.usable()) GTEST_SKIP() << "inotify is not available: errno " << errno;
    int autoWatch = watch.watch(autoDir);
    int procWatch = watch.watch(procDir);
    int sysWatch = watch.watch(sysDir);
    ASSERT_GE(autoWatch, 0);
    ASSERT_GE(procWatch, 0);
    ASSERT_GE(sysWatch, 0);

    testsupport::TraceCapture capture;
    accessToAllMountPaths();
    std::map<int, int> opened = watch.opened();

    EXPECT_GE(opened[autoWatch], 1) << "the automounter's directory was not listed";
    EXPECT_EQ(0, opened[procWatch]);
    EXPECT_EQ(0, opened[sysWatch]);
    // Every dummy row is still traced as visited.
    EXPECT_TRUE(capture.contains("accessToAllMountPaths - accessing path '" + autoDir + "' with special 'auto.home'"));
    EXPECT_TRUE(capture.contains("accessToAllMountPaths - accessing path '" + procDir + "' with special 'proc'"));
    EXPECT_TRUE(capture.contains("accessToAllMountPaths - accessing path '" + sysDir + "' with special 'sysfs'"));
    EXPECT_FALSE(capture.contains("accessing path '/' with special"));
}
