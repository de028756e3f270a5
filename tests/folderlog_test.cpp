#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <unistd.h>

#include "base/KelCfg.h"
#include "fscanner/fscommon/cache_common.h"
#include "support/testsupport.h"

namespace {

struct FolderLogTest : ::testing::Test {
    void SetUp() override { KelCfg::reset(); }
    void TearDown() override { KelCfg::reset(); }
};

int depthFor(const char* value)
{
    KelCfg::setKey("trace_nested_folder_limit", value);
    return getNestedFolderDepthForLogging();
}

}  // namespace

TEST_F(FolderLogTest, DepthDefaultsToFourWithoutKey)
{
    KelCfg::removeKey("trace_nested_folder_limit");
    EXPECT_EQ(4, getNestedFolderDepthForLogging());
    EXPECT_EQ(4, depthFor(""));
}

TEST_F(FolderLogTest, DepthOutOfRangeOrNotDigitsGivesFour)
{
    EXPECT_EQ(4, depthFor("100000"));
    EXPECT_EQ(4, depthFor("abc"));
    EXPECT_EQ(4, depthFor("-1"));
    EXPECT_EQ(4, depthFor("12a"));
    EXPECT_EQ(4, depthFor("99999999999999999999999"));
}

TEST_F(FolderLogTest, DepthTakesDigitsBelowHundredThousand)
{
    EXPECT_EQ(0, depthFor("0"));
    EXPECT_EQ(99999, depthFor("99999"));
    EXPECT_EQ(1, depthFor("1"));
    EXPECT_EQ(7, depthFor("007"));
}

TEST_F(FolderLogTest, OpenWritesHeadingAndEmptiesOldContent)
{
    testsupport::TempDir dir;
    dir.write("traceKEL_scanned_dirs.log", "old content from the last query\n");
    KelCfg::setKey("common_trace_path", dir.path().c_str());
    FILE* f = nullptr;
    ASSERT_FALSE(openFolderListLogfile(&f));
    ASSERT_NE(nullptr, f);
    EXPECT_EQ(0, closeFolderListLogfile(&f));
    EXPECT_EQ(nullptr, f);
    std::string text = testsupport::readFile(dir.file("traceKEL_scanned_dirs.log"));
    EXPECT_EQ("LIST OF SCANNED DIRECTORIES DURING SOFTWARE SCAN:\n", text);
    EXPECT_EQ(50u, text.size());
}

TEST_F(FolderLogTest, LinesAreAppendedInOrder)
{
    testsupport::TempDir dir;
    KelCfg::setKey("common_trace_path", dir.path().c_str());
    FILE* f = nullptr;
    ASSERT_FALSE(openFolderListLogfile(&f));
    logFolderName(f, L"/root/wide");
    logFolderName(f, "/root/narrow");
    logString(f, "summary line");
    closeFolderListLogfile(&f);
    std::string text = testsupport::readFile(dir.file("traceKEL_scanned_dirs.log"));
    std::string heading = "LIST OF SCANNED DIRECTORIES DURING SOFTWARE SCAN:\n";
    ASSERT_EQ(0u, text.find(heading));
    size_t wide = text.find(" '/root/wide'\n");
    size_t narrow = text.find(" '/root/narrow'\n");
    size_t summary = text.find("\nsummary line\n");
    ASSERT_NE(std::string::npos, wide);
    ASSERT_NE(std::string::npos, narrow);
    ASSERT_NE(std::string::npos, summary);
    EXPECT_LT(wide, narrow);
    EXPECT_LT(narrow, summary);
    // Each folder line starts with the local date and time, then a blank.
    std::string firstLine = text.substr(heading.size(), text.find('\n', heading.size()) - heading.size());
    EXPECT_GT(firstLine.find(" '/root/wide'"), 0u);
    EXPECT_NE(' ', firstLine[0]);
}

TEST_F(FolderLogTest, FailedOpenLeavesNullAndReportsErrno)
{
    testsupport::TempDir dir;
    KelCfg::setKey("common_trace_path", (dir.path() + "/missing/dir").c_str());
    FILE* f = reinterpret_cast<FILE*>(1);
    errno = 0;
    EXPECT_TRUE(openFolderListLogfile(&f));
    EXPECT_EQ(nullptr, f);
    EXPECT_EQ(ENOENT, errno);
    // Every later call does nothing on the null stream.
    logString(f, "x");
    logFolderName(f, L"/x");
    logFolderName(f, "/x");
    EXPECT_EQ(0, closeFolderListLogfile(&f));
}

TEST_F(FolderLogTest, EmptyTracePathUsesRootOfFileSystem)
{
    // With an empty "common_trace_path" the log goes to "/traceKEL_scanned_dirs.log".
    // Only checked when that place is not writable, so the test never writes there.
    KelCfg::setKey("common_trace_path", "");
    if (access("/", W_OK) == 0)
        GTEST_SKIP() << "running with write access to /";
    FILE* f = nullptr;
    errno = 0;
    EXPECT_TRUE(openFolderListLogfile(&f));
    EXPECT_EQ(nullptr, f);
    EXPECT_NE(0, errno);
}
