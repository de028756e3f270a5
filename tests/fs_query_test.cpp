// FsQuery: lists, case mode, the name/mask containers, the process-wide
// remote file system list and dump.
#include <gtest/gtest.h>

#include <iostream>
#include <sstream>
#include <string>

#include "base/kelmem.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/mountlist.h"
#include "support/testsupport.h"

using testsupport::TraceCapture;

namespace {

std::wstring dumpOf(FsQuery& query) {
    std::wostringstream captured;
    std::wstreambuf* old = std::wcout.rdbuf(captured.rdbuf());
    query.dump();
    std::wcout.rdbuf(old);
    return captured.str();
}

}  // namespace

TEST(FsQuery, Defaults) {
    FsQuery query;
    EXPECT_EQ(query.getQuery(), nullptr);
    EXPECT_TRUE(query.getCaseSensitive());
    EXPECT_EQ(query.getAssumeAutoFSDriveType(), dtAutoFS);
    EXPECT_EQ(query.getCpuThreshold(), nullptr);
    EXPECT_FALSE(query.getFirstTimeOnly());
    EXPECT_FALSE(query.isFileSystemScan());
    EXPECT_TRUE(query.getIncludedPaths().empty());
    EXPECT_EQ(query.getFileOrMaskForCachingSetSize(), 0u);
}

TEST(FsQuery, SetCaseSensitiveThreeKeepsModeAndDumpShowsTwoOnNewQuery) {
    FsQuery query;
    query.setCaseSensitive(3);
    EXPECT_TRUE(query.getCaseSensitive());
    std::wstring text = dumpOf(query);
    EXPECT_NE(text.find(L"caseSensitive=2\n"), std::wstring::npos) << std::string(text.begin(), text.end());
    query.setCaseSensitive(1);
    EXPECT_FALSE(query.getCaseSensitive());
    query.setCaseSensitive(7);
    EXPECT_FALSE(query.getCaseSensitive());
    query.setCaseSensitive(0);
    EXPECT_TRUE(query.getCaseSensitive());
}

TEST(FsQuery, AddPathsAndFileSystems) {
    TraceCapture capture;
    FsQuery query;
    EXPECT_EQ(query.addIncludePath(L"/usr", true), 1);
    EXPECT_EQ(query.addIncludePath(nullptr, true), 0);
    EXPECT_EQ(query.addExcludePath(L"/usr/tmp", false), 1);
    EXPECT_EQ(query.addExcludePath(nullptr, false), 0);
    EXPECT_EQ(query.addIncludeFileSystem(L"ext4"), 1);
    EXPECT_EQ(query.addIncludeFileSystem(nullptr), 0);
    EXPECT_EQ(query.addExcludeFileSystem(L"nfs"), 1);
    EXPECT_EQ(query.addExcludeFileSystem(nullptr), 0);
    ASSERT_EQ(query.getIncludedPaths().size(), 1u);
    EXPECT_STREQ(query.getIncludedPaths()[0].getPathName(), L"/usr");
    EXPECT_TRUE(query.getIncludedPaths()[0].getRecursive());
    ASSERT_EQ(query.getExcludedPaths().size(), 1u);
    EXPECT_FALSE(query.getExcludedPaths()[0].getRecursive());
    ASSERT_EQ(query.getIncludedFileSystems().size(), 1u);
    EXPECT_STREQ(query.getIncludedFileSystems()[0].getFileSystemName(), L"ext4");
    ASSERT_EQ(query.getExcludedFileSystems().size(), 1u);
    EXPECT_TRUE(capture.contains("adding include path to query: '/usr', recursive: 1"));
    EXPECT_EQ(query.clearIncludePaths(), 1);
    EXPECT_EQ(query.clearExcludePaths(), 1);
    EXPECT_EQ(query.clearIncludeFileSystems(), 1);
    EXPECT_EQ(query.clearExcludeFileSystems(), 1);
    EXPECT_TRUE(query.getIncludedPaths().empty());
    EXPECT_TRUE(query.getExcludedPaths().empty());
    EXPECT_TRUE(query.getIncludedFileSystems().empty());
    EXPECT_TRUE(query.getExcludedFileSystems().empty());
}

TEST(FsQuery, SetQueryReplacesAndNullKeepsOldText) {
    FsQuery query;
    EXPECT_EQ(query.setQuery(L"[SIZE] > 10"), 1);
    EXPECT_STREQ(query.getQuery(), L"[SIZE] > 10");
    EXPECT_EQ(query.setQuery(nullptr), 0);
    EXPECT_STREQ(query.getQuery(), L"[SIZE] > 10");
    EXPECT_EQ(query.setQuery(L"x"), 1);
    EXPECT_STREQ(query.getQuery(), L"x");
}

TEST(FsQuery, CpuThresholdIsCopiedAndSecondSetDropsFirstCopyWithoutReleasingIt) {
    FsQuery query;
    char text[] = "1:2:3:4";
    query.setCpuThreshold(text);
    text[0] = '9';
    EXPECT_STREQ(query.getCpuThreshold(), "1:2:3:4");
    // The first copy is not released by the second set: it is still ours to
    // free here (a release by the query would make this a double free).
    char* first = const_cast<char*>(query.getCpuThreshold());
    query.setCpuThreshold(nullptr);
    EXPECT_STREQ(first, "1:2:3:4");
    kelm_free(first);
    EXPECT_EQ(query.getCpuThreshold(), nullptr);
    query.setCpuThreshold("5:6:7:8");
    EXPECT_STREQ(query.getCpuThreshold(), "5:6:7:8");
}

TEST(FsQuery, FlagsAndDriveType) {
    FsQuery query;
    query.setFirstTimeOnly(true);
    query.setFileSystemScan(true);
    query.setAssumeAutoFSDriveType(dtRemote);
    EXPECT_TRUE(query.getFirstTimeOnly());
    EXPECT_TRUE(query.isFileSystemScan());
    EXPECT_EQ(query.getAssumeAutoFSDriveType(), dtRemote);
}

TEST(FsQuery, RemoteFileSystemsGoToTheProcessWideList) {
    MountTableManager::remoteFileSystems.clear();
    FsQuery query;
    EXPECT_EQ(query.addRemoteFileSystem("lustre"), 1);
    {
        FsQuery other;
        EXPECT_EQ(other.addRemoteFileSystem("beegfs"), 1);
    }
    ASSERT_EQ(MountTableManager::remoteFileSystems.size(), 2u);
    EXPECT_EQ(MountTableManager::remoteFileSystems.front(), "lustre");
    EXPECT_EQ(MountTableManager::remoteFileSystems.back(), "beegfs");
    EXPECT_EQ(query.clearRemoteFileSystems(), 1);
    EXPECT_TRUE(MountTableManager::remoteFileSystems.empty());
}

TEST(FsQuery, CaseInsensitiveModeFoldsNamesWhenAdded) {
    FsQuery query;
    query.setCaseSensitive(1);
    query.addFileOrMaskForQuery(L"Foo.TXT");
    EXPECT_TRUE(query.fileMatchesQuery(L"foo.txt"));
    EXPECT_TRUE(query.fileMatchesQuery(L"FOO.txt"));
    EXPECT_EQ(query.getFilesForQuery().count(L"foo.txt"), 1u);
}

TEST(FsQuery, CaseSensitiveModeMatchesExactNamesOnly) {
    FsQuery query;
    query.setCaseSensitive(2);
    query.addFileOrMaskForQuery(L"Foo.TXT");
    EXPECT_FALSE(query.fileMatchesQuery(L"foo.txt"));
    EXPECT_FALSE(query.fileMatchesQuery(L"FOO.txt"));
    EXPECT_TRUE(query.fileMatchesQuery(L"Foo.TXT"));
}

TEST(FsQuery, LaterModeChangeDoesNotRefoldStoredNames) {
    FsQuery query;
    query.addFileOrMaskForQuery(L"Foo.TXT");  // stored as is: mode 2
    query.setCaseSensitive(1);
    // The lookup is lowered now, the stored name is not.
    EXPECT_FALSE(query.fileMatchesQuery(L"Foo.TXT"));
}

TEST(FsQuery, DuplicateMasksAreKeptAndDuplicateNamesAreNot) {
    FsQuery query;
    query.addFileOrMaskForCaching(L"a*");
    query.addFileOrMaskForCaching(std::wstring(L"a*"));
    query.addFileOrMaskForCaching(L"abc");
    query.addFileOrMaskForCaching(std::wstring(L"abc"));
    EXPECT_EQ(query.getMasksForCaching().size(), 2u);
    EXPECT_EQ(query.getFilesForCaching().size(), 1u);
    EXPECT_EQ(query.getFileOrMaskForCachingSetSize(), 3u);
}

TEST(FsQuery, NullAndEmptyNamesAreSkippedWithTraces) {
    TraceCapture capture;
    FsQuery query;
    query.addFileOrMaskForCaching(static_cast<const wchar_t*>(nullptr));
    query.addFileOrMaskForCaching(L"");
    EXPECT_EQ(query.getFileOrMaskForCachingSetSize(), 0u);
    EXPECT_TRUE(capture.contains("nameOrNameMask is NULL, skipping it."));
    EXPECT_TRUE(capture.contains("nameOrNameMask is empty, skipping it."));
}

TEST(FsQuery, EmptyNameIsNeverCachedWhateverTheMasks) {
    TraceCapture capture;
    FsQuery query;
    query.addFileOrMaskForCaching(L"*");
    EXPECT_FALSE(query.fileShouldBeCached(L""));
    EXPECT_TRUE(capture.contains("name to find is empty, nothing to find - returning false."));
    EXPECT_TRUE(query.fileShouldBeCached(L"x"));
}

TEST(FsQuery, MasksAreTriedInInsertionOrderAfterExactNames) {
    FsQuery query;
    query.addFileOrMaskForQuery(L"*.log");
    query.addFileOrMaskForQuery(L"data?.bin");
    query.addFileOrMaskForQuery(L"exact.txt");
    EXPECT_TRUE(query.fileMatchesQuery(L"exact.txt"));
    EXPECT_TRUE(query.fileMatchesQuery(L"system.log"));
    EXPECT_TRUE(query.fileMatchesQuery(L"data1.bin"));
    EXPECT_FALSE(query.fileMatchesQuery(L"data12.bin"));
    EXPECT_FALSE(query.fileMatchesQuery(L"exact.txt2"));
    std::vector<std::wstring> masks = query.getMasksForQuery();
    ASSERT_EQ(masks.size(), 2u);
    EXPECT_EQ(masks[0], L"*.log");
    EXPECT_EQ(masks[1], L"data?.bin");
    EXPECT_FALSE(query.fileShouldBeCached(L"system.log"));
}

TEST(FsQuery, NarrowContainerInstantiation) {
    FsQuery query;
    query.setCaseSensitive(1);
    std::vector<std::string> masks;
    std::set<std::string> names;
    query.addNameOrNameMaskToRightContainer<char, std::string>("Lib*.SO", masks, names);
    query.addNameOrNameMaskToRightContainer<char, std::string>(std::string("README"), masks, names);
    ASSERT_EQ(masks.size(), 1u);
    EXPECT_EQ(masks[0], "lib*.so");
    EXPECT_EQ(names.count("readme"), 1u);
    EXPECT_TRUE((query.nameFoundOrMatchedAMask<char, std::string>(std::string("LIBc.so"), masks, names)));
    EXPECT_TRUE((query.nameFoundOrMatchedAMask<char, std::string>(std::string("ReadMe"), masks, names)));
    EXPECT_FALSE((query.nameFoundOrMatchedAMask<char, std::string>(std::string("x"), masks, names)));
}

TEST(FsQuery, DumpWritesQueryAndListsInOrder) {
    FsQuery query;
    query.setQuery(L"[SIZE] > 1");
    query.setAssumeAutoFSDriveType(dtRemote);
    query.addIncludePath(L"/usr", true);
    query.addIncludePath(L"/opt", false);
    query.addExcludePath(L"/usr/tmp", false);
    query.addIncludeFileSystem(L"ext4");
    query.addExcludeFileSystem(L"nfs");
    query.addFileOrMaskForQuery(L"hidden*");
    std::wstring expected =
        L"query=[SIZE] > 1\n"
        L"caseSensitive=2\n"
        L"assumeAutoFSDriveType=4\n"
        L"\n"
        L"-- includedPathList ---------------------------\n"
        L" path=/usr; recursive=1\n"
        L" path=/opt; recursive=0\n"
        L"\n"
        L"-- excludedPathList ---------------------------\n"
        L" path=/usr/tmp; recursive=0\n"
        L"\n"
        L"-- includedFileSystemList ---------------------------\n"
        L" name=ext4\n"
        L"\n"
        L"-- excludedFileSystemList ---------------------------\n"
        L" name=nfs\n";
    EXPECT_EQ(dumpOf(query), expected);
}

TEST(FsQuery, VirtualSlotsDispatchThroughBase) {
    struct Counting : FsQuery {
        int adds = 0;
        void addFileOrMaskForCaching(const wchar_t* name) override {
            ++adds;
            FsQuery::addFileOrMaskForCaching(name);
        }
    };
    Counting counting;
    FsQuery& base = counting;
    base.addFileOrMaskForCaching(L"x");
    EXPECT_EQ(counting.adds, 1);
    EXPECT_TRUE(base.fileShouldBeCached(L"x"));
}
