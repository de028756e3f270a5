// Files of 2 GiB and more: their sizes and sums come out right through the
// direct walk, the cache and the tool, on every target.  On 32-bit Linux the
// C library's lstat fails with EOVERFLOW on such a file unless the library is
// built with large-file support, and the file would be reported with size 0.
// The big file is sparse (ftruncate), so it costs no disk space.
#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <map>
#include <sstream>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/fileprocessor.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/sysfile.h"
#include "support/cachefixture.h"
#include "support/testsupport.h"

namespace {

using testsupport::TempDir;
using testsupport::widen;

const unsigned long long kBigSize = 3ull << 30;  // 3 GiB
const std::string kTool = std::string(FSCANNER_TEST_BINARY_DIR) + "/fsquery";

// Full path -> size of every hit.
class SizeWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int,
                  const wchar_t*, unsigned int, unsigned int) override {
        sizes[testsupport::joinPath(testsupport::bytesOf(path), testsupport::bytesOf(name))] = size;
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        sizes[testsupport::joinPath(testsupport::bytesOf(info.getPath()), testsupport::bytesOf(info.getName()))] =
            info.getSize();
        return 0;
    }
    int close() override { return 0; }
    std::map<std::string, unsigned long long> sizes;
};

class LargeFileTest : public ::testing::Test {
protected:
    void SetUp() override {
        tree = dir.mkdirs("tree");
        int fd = open((tree + "/big").c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
        ASSERT_GE(fd, 0);
        ASSERT_EQ(0, ftruncate(fd, static_cast<off_t>(kBigSize)));
        close(fd);
        dir.write("tree/small", "abc");
        dir.write("tree/sub/tiny", "x");
        expected = {{tree + "/big", kBigSize}, {tree + "/small", 3}, {tree + "/sub/tiny", 1}};
        mtab = dir.write("mtab", "/dev/sda1 / ext4 rw 0 0\n");
    }

    // The tool's CSV output as path -> the named column.
    std::map<std::string, std::string> toolColumn(const std::vector<std::string>& args, const std::string& column,
                                                  int* status) {
        std::string outName = dir.file("tool.out");
        pid_t pid = fork();
        if (pid == 0) {
            int out = open(outName.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
            int null = open("/dev/null", O_RDWR);
            dup2(null, 0);
            dup2(out, 1);
            dup2(null, 2);
            std::vector<std::string> argv{kTool, "--mount-table", mtab, "--format", "csv"};
            argv.insert(argv.end(), args.begin(), args.end());
            argv.push_back(tree);
            testsupport::execBuildProgram(argv);
            _exit(98);
        }
        int raw = 0;
        waitpid(pid, &raw, 0);
        *status = WIFEXITED(raw) ? WEXITSTATUS(raw) : 128 + WTERMSIG(raw);
        std::istringstream in(testsupport::readFile(outName));
        std::string line;
        std::vector<std::string> header;
        std::map<std::string, std::string> result;
        while (std::getline(in, line)) {
            std::vector<std::string> cells;
            std::istringstream fields(line);
            std::string cell;
            while (std::getline(fields, cell, ',')) cells.push_back(cell);
            if (header.empty()) {
                header = cells;
                continue;
            }
            std::string path, value;
            for (size_t i = 0; i < header.size() && i < cells.size(); ++i) {
                if (header[i] == "fullPath") path = cells[i];
                if (header[i] == column) value = cells[i];
            }
            result[path] = value;
        }
        return result;
    }

    TempDir dir;
    std::string tree;
    std::string mtab;
    std::map<std::string, unsigned long long> expected;
};

TEST_F(LargeFileTest, StatusOfTheBigFileGivesItsFullSize) {
    FsFileInfo info;
    info.setFilePath(widen(tree + "/").c_str());
    info.setFileName(L"big");
    EXPECT_TRUE(info.updateInfo());
    EXPECT_EQ(kBigSize, info.getSize());
}

TEST_F(LargeFileTest, DirectWalkReportsTheBigFileWithItsSize) {
    SizeWriter writer;
    FileProcessor processor(L"[SIZE]>=0", true);
    std::vector<PathInfo> includes, excludes;
    PathDrive root(widen(tree).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(0, fs_build(writer, processor, root, includes, excludes, true, 2000000000));
    EXPECT_EQ(expected, writer.sizes);
}

TEST_F(LargeFileTest, SizeConditionComparesTheFullSize) {
    // The condition compares the 64-bit size: no wrap makes the 3 GiB file
    // look small.
    SizeWriter writer;
    FileProcessor processor(L"[SIZE]>3000000000", true);
    std::vector<PathInfo> includes, excludes;
    PathDrive root(widen(tree).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(0, fs_build(writer, processor, root, includes, excludes, true, 2000000000));
    EXPECT_EQ((std::map<std::string, unsigned long long>{{tree + "/big", kBigSize}}), writer.sizes);
}

TEST_F(LargeFileTest, CacheBuildsAndServesTheBigFileWithItsSize) {
    testsupport::MachineFixture machine;
    TempDir cacheDir;
    FsGlue glue = testsupport::plainGlue();
    for (int run = 0; run < 2; ++run) {  // the first run builds, the second is served
        FS_Cache cache(L"dirs", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
        FsQuery query;
        query.setQuery(L"[SIZE]>=0");
        query.addIncludePath(widen(tree).c_str(), true);
        SizeWriter writer;
        EXPECT_EQ(0, cache.executeQueryEx(writer, query, 600000, 3600)) << "run " << run;
        EXPECT_EQ(expected, writer.sizes) << "run " << run;
        cache.close();
    }
}

TEST_F(LargeFileTest, ToolReportsTheBigFileWithItsSizeInBothModes) {
    std::map<std::string, std::string> want;
    for (const auto& e : expected) want[e.first] = std::to_string(e.second);
    int status = -1;
    EXPECT_EQ(want, toolColumn({"--no-cache"}, "size", &status));
    EXPECT_EQ(0, status);
    std::vector<std::string> cached{"--cache", dir.file("cache")};
    EXPECT_EQ(want, toolColumn(cached, "size", &status));  // builds
    EXPECT_EQ(0, status);
    EXPECT_EQ(want, toolColumn(cached, "size", &status));  // served
    EXPECT_EQ(0, status);
}

// Reads all 3 GiB (of zeros): about 5 s natively, over a minute under
// emulation.
TEST_F(LargeFileTest, Md5OfTheBigFileMatchesMd5sum) {
    std::string sum = testsupport::runCommand("md5sum '" + tree + "/big'");
    ASSERT_GE(sum.size(), 32u) << "md5sum is needed";
    int status = -1;
    std::map<std::string, std::string> sums = toolColumn({"--no-cache", "--md5"}, "md5", &status);
    EXPECT_EQ(0, status);
    EXPECT_EQ(sum.substr(0, 32), sums[tree + "/big"]);
    EXPECT_EQ(3u, sums.size());
}

}  // namespace

namespace {

// Table and result files describe their sizes in 32 bits.  A file longer than
// that is refused, not read as its length modulo 4 GiB, and left untouched.
TEST(LargeFileRefused, MappedFileOfMoreThanFourGibibytesIsNotOpenedAndKeepsItsLength) {
    testsupport::TempDir dir;
    std::string name = dir.file("huge.dat");
    int fd = open(name.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    ASSERT_GE(fd, 0);
    const off_t length = static_cast<off_t>((4ull << 30) + 4096);
    ASSERT_EQ(0, ftruncate(fd, length));
    close(fd);
    {
        AbstractMmFile* file = SysFactory::createMmFile(widen(name).c_str());
        ASSERT_NE(nullptr, file);
        EXPECT_FALSE(file->open());
        delete file;
    }
    struct stat st;
    ASSERT_EQ(0, stat(name.c_str(), &st));
    EXPECT_EQ(length, st.st_size);
    AbstractStdFile* file = SysFactory::createStdFile(widen(name).c_str());
    ASSERT_NE(nullptr, file);
    ASSERT_TRUE(file->open());
    unsigned int size = 12345;
    EXPECT_FALSE(file->size(&size));
    EXPECT_EQ(12345u, size);
    file->close();
    delete file;
}

}  // namespace
