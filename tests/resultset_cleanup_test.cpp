// The clean-up handler of a result file, as a process that ends calls it:
// with the file go the scratch files of a sort that may be running on it.
#include <gtest/gtest.h>

#include <string>

#include "fscanner/fs/fs_loader.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "support/testsupport.h"

namespace {

using testsupport::fileExists;

TEST(ResultSetCleanup, HandlerRemovesTheFileAndTheScratchFilesOfItsSort) {
    testsupport::TempDir dir;
    std::string name = dir.write("result", "records");
    dir.write("result.a", "half of them");
    dir.write("result.b", "the other half");
    dir.write("result.c", "not the sort's");
    deleteFile_CleanupHandler(15, &name[0]);
    EXPECT_FALSE(fileExists(name));
    EXPECT_FALSE(fileExists(name + ".a"));
    EXPECT_FALSE(fileExists(name + ".b"));
    EXPECT_TRUE(fileExists(name + ".c"));
}

TEST(ResultSetCleanup, HandlerWithCodeZeroLeavesTheScratchFilesToo) {
    testsupport::TempDir dir;
    std::string name = dir.write("result", "records");
    dir.write("result.a", "scratch");
    deleteFile_CleanupHandler(0, &name[0]);
    EXPECT_TRUE(fileExists(name));
    EXPECT_TRUE(fileExists(name + ".a"));
}

TEST(ResultSetCleanup, ScratchFilesWithoutTheFileAreRemovedAsWell) {
    // A sort between re-creating the file and writing it back: the records
    // are only in the scratch files.
    testsupport::TempDir dir;
    std::string name = dir.file("result");
    dir.write("result.a", "scratch");
    dir.write("result.b", "scratch");
    deleteFile_CleanupHandler(2, &name[0]);
    EXPECT_FALSE(fileExists(name + ".a"));
    EXPECT_FALSE(fileExists(name + ".b"));
}

TEST(ResultSetCleanup, ALiveSetsRegistrationRemovesItsScratchFiles) {
    testsupport::TempDir dir;
    std::string prefix = dir.path() + "/";
    FsResultSet_OnFile::setTempNameSources([](char*) -> char* { return nullptr; }, prefix.c_str(),
                                           "/nonexistent-dir/");
    {
        FsResultSet_OnFile set;
        std::string name = set.getFileName();
        FsFileInfo info;
        info.setFilePath(L"/");
        info.setFileName(L"a");
        ASSERT_EQ(0, set.getWriter()->addRecord(info));
        set.getWriter()->close();
        dir.write("fsq_0.a", "scratch");
        dir.write("fsq_0.b", "scratch");
        FsResourceManager::getInstance()->invokeCleanupHandlers(15);
        EXPECT_FALSE(fileExists(name));
        EXPECT_FALSE(fileExists(name + ".a"));
        EXPECT_FALSE(fileExists(name + ".b"));
    }
    FsResultSet_OnFile::resetTempNameSources();
}

}  // namespace
