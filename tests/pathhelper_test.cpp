// Path lists and the exclude lists of a scan root.
#include <gtest/gtest.h>

#include <unistd.h>

#include <cstring>
#include <cwchar>
#include <string>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fscommon/pathhelper.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& text) { return std::wstring(text.begin(), text.end()); }

std::wstring str(const wchar_t* text) { return text ? std::wstring(text) : std::wstring(L"<null>"); }

// realPath through the wide form, as a std::wstring ("<null>" for null).
std::wstring real(const std::wstring& path, bool followLinks = false) {
    PathHelper helper;
    wchar_t* result = helper.realPath(path.c_str(), followLinks);
    std::wstring out = str(result);
    kelm_free(result);
    return out;
}

std::wstring cwd() {
    char buffer[4096];
    EXPECT_NE(nullptr, getcwd(buffer, sizeof(buffer)));
    return wide(buffer);
}

// "path|recursive" per entry.
std::vector<std::wstring> describe(const std::vector<PathInfo>& list) {
    std::vector<std::wstring> out;
    for (const PathInfo& p : list) out.push_back(str(p.getPathName()) + (p.getRecursive() ? L"|r" : L"|n"));
    return out;
}

typedef std::vector<std::wstring> Names;

std::wstring resolvedPath(const wchar_t* in) {
    std::vector<wchar_t> out(4096, L'x');
    PathHelper().buildResolvedPath(in, out.data());
    return out.data();
}

std::wstring expand(const wchar_t* in, unsigned int size, int expected) {
    std::vector<wchar_t> out(size + 1, L'\0');
    PathHelper helper;
    EXPECT_EQ(expected, helper.expand_path_variable(const_cast<wchar_t*>(in), out.data(), size)) << in;
    return out.data();
}

}  // namespace

// --- realPath ---------------------------------------------------------------

TEST(RealPath, DotDotNeverPassesTheRoot) {
    EXPECT_EQ(L"/a", real(L"/../a"));
    EXPECT_EQ(L"/", real(L"/.."));
    EXPECT_EQ(L"/b", real(L"/a/../../b"));
}

TEST(RealPath, RootStaysRoot) { EXPECT_EQ(L"/", real(L"/")); }

TEST(RealPath, RelativePathGoesBehindTheWorkingDirectory) {
    EXPECT_EQ(cwd() + L"/a/b", real(L"a/./b/"));
    EXPECT_EQ(cwd() + L"/x", real(L"x"));
}

TEST(RealPath, RepeatedSeparatorsAndDotsAreDropped) {
    EXPECT_EQ(L"/usr/lib", real(L"//usr///./lib/"));
    EXPECT_EQ(L"/usr", real(L"/usr/lib/.."));
}

TEST(RealPath, PathOf4096BytesGivesNull) {
    std::wstring longPath = L"/" + std::wstring(4095, L'a');
    ASSERT_EQ(4096u, longPath.size());
    EXPECT_EQ(L"<null>", real(longPath));
    std::wstring fits = L"/" + std::wstring(4094, L'a');
    EXPECT_EQ(fits, real(fits));
}

TEST(RealPath, NarrowFormGivesNarrowResult) {
    PathHelper helper;
    char* result = helper.realPath("/usr/../etc//", false);
    ASSERT_NE(nullptr, result);
    EXPECT_STREQ("/etc", result);
    kelm_free(result);
    EXPECT_EQ(nullptr, helper.realPath(std::string(5000, 'a').c_str(), false));
    EXPECT_EQ(nullptr, helper.realPath(static_cast<const char*>(nullptr), false));
}

TEST(RealPath, LinksStayUnlessFollowed) {
    testsupport::TempDir dir;
    dir.mkdirs("target/sub");
    ASSERT_EQ(0, symlink("target", dir.file("rel").c_str()));
    ASSERT_EQ(0, symlink(dir.file("target").c_str(), dir.file("abs").c_str()));
    std::wstring base = real(wide(dir.path()), true);
    EXPECT_EQ(wide(dir.path()) + L"/rel/sub", real(wide(dir.file("rel/sub"))));
    EXPECT_EQ(base + L"/target/sub", real(wide(dir.file("rel/sub")), true));
    EXPECT_EQ(base + L"/target/sub", real(wide(dir.file("abs/sub")), true));
}

TEST(RealPath, FollowingFailsOnMissingComponentAndOnLinkLoops) {
    testsupport::TempDir dir;
    ASSERT_EQ(0, symlink("b", dir.file("a").c_str()));
    ASSERT_EQ(0, symlink("a", dir.file("b").c_str()));
    EXPECT_EQ(L"<null>", real(wide(dir.file("a")), true));
    EXPECT_EQ(L"<null>", real(wide(dir.file("missing/x")), true));
    // Lexically the same paths are fine.
    EXPECT_EQ(wide(dir.file("missing/x")), real(wide(dir.file("missing/x"))));
}

// --- expand_path_variable ------------------------------------------------------

TEST(ExpandPathVariable, LonePercentIsCopied) {
    EXPECT_EQ(L"%", expand(L"%", 4096, 0));
    EXPECT_EQ(L"100%", expand(L"100%", 4096, 0));
}

TEST(ExpandPathVariable, UnknownNamesStayAsWritten) {
    EXPECT_EQ(L"%HOME%/x", expand(L"%HOME%/x", 4096, 0));
    EXPECT_EQ(L"a%b%c%d", expand(L"a%b%c%d", 4096, 0));
    EXPECT_EQ(L"%%", expand(L"%%", 4096, 0));
}

TEST(ExpandPathVariable, BadArgumentsGiveMinusOne) {
    PathHelper helper;
    wchar_t out[8];
    EXPECT_EQ(-1, helper.expand_path_variable(nullptr, out, 8));
    EXPECT_EQ(-1, helper.expand_path_variable(const_cast<wchar_t*>(L"x"), nullptr, 8));
    EXPECT_EQ(-1, helper.expand_path_variable(const_cast<wchar_t*>(L"x"), out, 0));
}

TEST(ExpandPathVariable, OutputReachingSizeGivesMinusTwo) {
    expand(L"abc", 4, 0);
    expand(L"abc", 3, -2);
    expand(L"%HOME%", 6, -2);
    EXPECT_EQ(L"%HOME%", expand(L"%HOME%", 7, 0));
}

TEST(ExpandPathVariable, TableHoldsOnlyItsEndRow) {
    EXPECT_STREQ(L"__LAST_ENTRY__", PathHelper::path_variables[0].name);
}

// --- buildRealPath / buildResolvedPath -------------------------------------------

TEST(BuildRealPath, WildcardPathIsCopiedAsItIs) {
    PathHelper helper;
    wchar_t* out = nullptr;
    ASSERT_TRUE(helper.buildRealPath(const_cast<wchar_t*>(L"/usr/../lib/*.so"), &out));
    EXPECT_EQ(L"/usr/../lib/*.so", str(out));
    kelm_free(out);
    ASSERT_TRUE(helper.buildRealPath(const_cast<wchar_t*>(L"/usr/../lib"), &out));
    EXPECT_EQ(L"/lib", str(out));
    kelm_free(out);
    std::wstring tooLong = L"/" + std::wstring(4100, L'a');
    EXPECT_FALSE(helper.buildRealPath(const_cast<wchar_t*>(tooLong.c_str()), &out));
    EXPECT_EQ(nullptr, out);
}

TEST(BuildRealPath, ListFormDropsPathsWithoutRealPath) {
    std::wstring tooLong = L"/" + std::wstring(4100, L'a');
    std::vector<PathInfo> in{PathInfo(L"/a/../b/", true), PathInfo(L"/x/*.c", false),
                             PathInfo(tooLong.c_str(), true)};
    std::vector<PathInfo> out;
    PathHelper().buildRealPath(in, out);
    EXPECT_EQ((Names{L"/b|r", L"/x/*.c|n"}), describe(out));
}

TEST(BuildResolvedPath, CutsBeforeTheFirstWildcard) {
    EXPECT_EQ(L"/usr:/lib/", resolvedPath(L"/usr:/lib/*.so"));
    EXPECT_EQ(L"/usr:/", resolvedPath(L"/usr:*.so"));
    EXPECT_EQ(L"/usr:/", resolvedPath(L"/usr:/*.so"));
    EXPECT_EQ(L"/usr:/usr/lib", resolvedPath(L"/usr:/usr/lib"));
    EXPECT_EQ(L"/a/", resolvedPath(L"/a/b?/c"));
    EXPECT_EQ(L"/", resolvedPath(L"*.tmp"));
    EXPECT_EQ(L"?:/usr/", resolvedPath(L"?:/usr/*"));
    EXPECT_EQ(L"?:/usr", resolvedPath(L"?:/usr"));
}

TEST(MapKeys, AreConcatenations) {
    EXPECT_EQ(L"ab", PathHelper::getDriveKeyForMap(L"a", L"b"));
    EXPECT_EQ(L"/usr:ext4", PathHelper::getDriveKeyForMap(DriveInfo(L"/usr:", dtLocal, L"ext4")));
    EXPECT_EQ(L"/usr/lib/usr:ext4",
              PathHelper::getPathDriveKeyForMap(PathDrive(L"/usr/lib", true, DriveInfo(L"/usr:", dtLocal, L"ext4"))));
}

// --- list lookups ----------------------------------------------------------------

TEST(CheckPathListEx, LongestMatchWinsAndEarlierOfEquals) {
    std::vector<PathInfo> list{PathInfo(L"/", true), PathInfo(L"/usr", true), PathInfo(L"/us?", true),
                               PathInfo(L"/usr/lib", false)};
    EXPECT_EQ(1, checkPathListEx(L"/usr/share", list, true));
    EXPECT_EQ(0, checkPathListEx(L"/var", list, true));
    EXPECT_EQ(1, checkPathListEx(L"/usr/lib/x", list, true));
    EXPECT_EQ(3, checkPathListEx(L"/usr/lib", list, true));
    std::vector<PathInfo> none{PathInfo(L"/opt", false)};
    EXPECT_EQ(-1, checkPathListEx(L"/usr", none, true));
}

TEST(CheckPathListEx, EmptyNameNeverWins) {
    std::vector<PathInfo> list{PathInfo(L"", true), PathInfo(nullptr, true)};
    EXPECT_EQ(-1, checkPathListEx(L"/usr", list, true));
}

TEST(CheckPathListEx, CaseFlag) {
    std::vector<PathInfo> list{PathInfo(L"/USR", true)};
    EXPECT_EQ(-1, checkPathListEx(L"/usr/x", list, true));
    EXPECT_EQ(0, checkPathListEx(L"/usr/x", list, false));
}

TEST(CheckPathDriveListEx, OnlyEntriesOfTheMaskCount) {
    std::vector<PathDrive> list{PathDrive(L"/usr/lib", true, DriveInfo(L"/:", dtRemote, L"nfs")),
                                PathDrive(L"/usr", true, DriveInfo(L"/:", dtLocal, L"ext4"))};
    EXPECT_EQ(1, checkPathDriveListEx(L"/usr/lib/x", list, 2, true));
    EXPECT_EQ(0, checkPathDriveListEx(L"/usr/lib/x", list, 31, true));
    EXPECT_EQ(-1, checkPathDriveListEx(L"/usr/lib/x", list, 0, true));
}

TEST(FileSystemPathChecker, DeepestMountDecides) {
    std::vector<PathInfo> included{PathInfo(L"/", true), PathInfo(L"/mnt/a", true)};
    std::vector<PathInfo> excluded{PathInfo(L"/mnt", true)};
    PathHelper helper;
    EXPECT_TRUE(helper.fileSystemPathChecker(L"/mnt/a/x", included, excluded));
    EXPECT_TRUE(helper.fileSystemPathChecker(L"/mnt/a", included, excluded));
    EXPECT_FALSE(helper.fileSystemPathChecker(L"/mnt/b", included, excluded));
    EXPECT_FALSE(helper.fileSystemPathChecker(L"/mnt", included, excluded));
    EXPECT_TRUE(helper.fileSystemPathChecker(L"/usr", included, excluded));
}

TEST(FileSystemPathChecker, DrivePrefixIsCutAway) {
    std::vector<PathInfo> included{PathInfo(L"/", true)};
    std::vector<PathInfo> excluded{PathInfo(L"/mnt", true)};
    PathHelper helper;
    EXPECT_FALSE(helper.fileSystemPathChecker(L"/mnt:/mnt/b", included, excluded));
    EXPECT_FALSE(helper.fileSystemPathChecker(L"?:/mnt/b", included, excluded));
    EXPECT_TRUE(helper.fileSystemPathChecker(L"?:/usr", included, excluded));
}

TEST(FileSystemPathChecker, ExcludedWithNoIncludedGoes) {
    std::vector<PathInfo> included;
    std::vector<PathInfo> excluded{PathInfo(L"/mnt", true)};
    EXPECT_FALSE(PathHelper().fileSystemPathChecker(L"/mnt/x", included, excluded));
    EXPECT_TRUE(PathHelper().fileSystemPathChecker(L"/usr", included, excluded));
}

TEST(PathLists, PathLocationIgnoresCase) {
    std::vector<DriveInfo> drives{DriveInfo(L"/usr:", dtLocal, L"ext4")};
    PathHelper helper;
    PathInfo a(L"/USR:/usr/lib", true), b(L"/var:/x", true);
    EXPECT_TRUE(helper.pathLocation(a, drives));
    EXPECT_FALSE(helper.pathLocation(b, drives));
}

TEST(PathLists, ContainsPathInfoIgnoresRecursiveFlag) {
    std::vector<PathInfo> list{PathInfo(L"/usr", true)};
    PathHelper helper;
    PathInfo flat(L"/usr", false), other(L"/USR", true);
    EXPECT_TRUE(helper.containsPathInfo(list, flat));
    EXPECT_FALSE(helper.containsPathInfo(list, other));
}

TEST(PathLists, RemoveDuplicateKeepsTheLastOfEachGroupInItsPlace) {
    std::vector<PathInfo> list{PathInfo(L"/a", true), PathInfo(L"/b", true), PathInfo(L"/a", false),
                               PathInfo(L"/a", true), PathInfo(L"/c", true), PathInfo(L"/b", true)};
    PathHelper helper;
    EXPECT_TRUE(helper.removePathListDuplicate(list));
    EXPECT_EQ((Names{L"/a|n", L"/a|r", L"/c|r", L"/b|r"}), describe(list));
    EXPECT_FALSE(helper.removePathListDuplicate(list));
}

TEST(PathLists, DifferenceUsesWholeEquality) {
    std::vector<PathInfo> a{PathInfo(L"/", true), PathInfo(L"/home", true), PathInfo(L"/boot", true)};
    std::vector<PathInfo> b{PathInfo(L"/", true), PathInfo(L"/boot", false)};
    std::vector<PathInfo> out{PathInfo(L"/kept", true)};
    PathHelper().differencePathList(a, b, out);
    EXPECT_EQ((Names{L"/kept|r", L"/home|r", L"/boot|r"}), describe(out));
}

TEST(PathLists, ExtractWithMaskZeroAppendsNothing) {
    std::vector<PathDrive> in{PathDrive(L"/usr", true, DriveInfo(L"/:", dtLocal, L"ext4")),
                              PathDrive(L"/home", false, DriveInfo(L"/home:", dtRemote, L"nfs"))};
    std::vector<PathInfo> out;
    PathHelper helper;
    helper.extractPathList(in, 0, out);
    EXPECT_TRUE(out.empty());
    helper.extractPathList(in, 4, out);
    EXPECT_EQ((Names{L"/home|n"}), describe(out));
    helper.extractPathList(in, 27, out);
    EXPECT_EQ((Names{L"/home|n", L"/usr|r"}), describe(out));
}

TEST(PathLists, BuildPathListDropsTheColon) {
    std::vector<DriveInfo> drives{DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs")};
    std::vector<PathInfo> out;
    PathHelper().buildPathList(drives, out);
    EXPECT_EQ((Names{L"/|r", L"/home|r"}), describe(out));
}

TEST(PathLists, AppendPathListUniqueSkipsEqualEntries) {
    std::vector<PathInfo> src{PathInfo(L"/a", true), PathInfo(L"/b", true), PathInfo(L"/a", false)};
    std::vector<PathInfo> dst{PathInfo(L"/a", true), PathInfo(L"/a", true)};
    PathHelper helper;
    helper.appendPathList(src, dst, true);
    EXPECT_EQ((Names{L"/a|r", L"/b|r", L"/a|n"}), describe(dst));
    std::vector<PathInfo> dst2{PathInfo(L"/a", true)};
    helper.appendPathList(src, dst2, false);
    EXPECT_EQ((Names{L"/a|r", L"/a|r", L"/b|r", L"/a|n"}), describe(dst2));
}

TEST(PathLists, FilterByDriveMatchesThroughTheFirstColonIgnoringCase) {
    std::vector<PathInfo> in{PathInfo(L"/usr:/usr/lib", true), PathInfo(L"/USR:/usr/x", false),
                             PathInfo(L"/usr/local:/usr/local", true), PathInfo(L"/:/usr", true)};
    std::vector<PathInfo> out;
    PathInfo path(L"/usr:/anything", true);
    PathHelper().pathFilterByDrive(path, in, out);
    EXPECT_EQ((Names{L"/usr:/usr/lib|r", L"/USR:/usr/x|n"}), describe(out));
}

TEST(InsertSorted, EqualValuesKeepArrivalOrder) {
    std::vector<std::pair<int, char>> list;
    auto less = [](const std::pair<int, char>& a, const std::pair<int, char>& b) { return a.first < b.first; };
    utils::insert_sorted(list, std::make_pair(2, 'a'), less);
    utils::insert_sorted(list, std::make_pair(1, 'b'), less);
    utils::insert_sorted(list, std::make_pair(2, 'c'), less);
    utils::insert_sorted(list, std::make_pair(1, 'd'), less);
    ASSERT_EQ(4u, list.size());
    EXPECT_EQ('b', list[0].second);
    EXPECT_EQ('d', list[1].second);
    EXPECT_EQ('a', list[2].second);
    EXPECT_EQ('c', list[3].second);
}

// --- pathReducer -----------------------------------------------------------------

TEST(PathReducer, SplitsIntoLevelsDeepestFirst) {
    std::vector<PathInfo> paths, names;
    PathHelper().pathReducer(PathInfo(L"/usr/lib/x", true), paths, names);
    EXPECT_EQ((Names{L"/usr/lib/x|r", L"/usr/lib|r", L"/usr|r", L"/|r"}), describe(paths));
    EXPECT_EQ((Names{L"x|r", L"lib|r", L"usr|r", L"/|r"}), describe(names));
}

TEST(PathReducer, TrailingSeparatorSkipsTheFirstLevel) {
    std::vector<PathInfo> paths, names;
    PathHelper().pathReducer(PathInfo(L"/usr/", false), paths, names);
    EXPECT_EQ((Names{L"/usr|n", L"/|n"}), describe(paths));
    EXPECT_EQ((Names{L"usr|n", L"/|n"}), describe(names));
}

TEST(PathReducer, RootAndBareNames) {
    std::vector<PathInfo> paths, names;
    PathHelper helper;
    helper.pathReducer(PathInfo(L"/", true), paths, names);
    EXPECT_EQ((Names{L"/|r"}), describe(paths));
    EXPECT_EQ((Names{L"/|r"}), describe(names));
    paths.clear();
    names.clear();
    helper.pathReducer(PathInfo(L"abc", false), paths, names);
    EXPECT_EQ((Names{L"abc|n"}), describe(paths));
    EXPECT_EQ((Names{L"abc|n"}), describe(names));
    paths.clear();
    names.clear();
    helper.pathReducer(PathInfo(L"/etc", false), paths, names);
    EXPECT_EQ((Names{L"/etc|n", L"/|n"}), describe(paths));
    EXPECT_EQ((Names{L"etc|n", L"/|n"}), describe(names));
}

// --- exclude lists -----------------------------------------------------------------

namespace {

std::vector<std::wstring> describeDrives(const std::vector<DriveInfo>& drives) {
    std::vector<std::wstring> out;
    for (const DriveInfo& d : drives)
        out.push_back(str(d.getDriveName()) + L"|" + std::to_wstring(d.getDriveType()) + L"|" +
                      str(d.getDriveFileSystem()) + (d.getExcludedDrive() ? L"|x" : L""));
    return out;
}

std::vector<std::wstring> excludesFor(std::vector<DriveInfo> drives, PathDrive root) {
    std::vector<PathInfo> out;
    PathHelper().buildExcludeList(drives, root, out);
    return describe(out);
}

}  // namespace

TEST(ReduceDriveList, DfsTwinsSettleOnTheRootsKind) {
    std::vector<DriveInfo> drives{DriveInfo(L"/dfs:", dtRemote, L"dfs"), DriveInfo(L"/dfs:", dtLocal, L"dfs"),
                                  DriveInfo(L"/:", dtLocal, L"ext4")};
    PathHelper helper;
    PathDrive localRoot(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    std::vector<DriveInfo> out;
    testsupport::TraceCapture capture;
    helper.reduceDriveList(drives, out, localRoot);
    EXPECT_EQ((Names{L"/:|2|ext4", L"/dfs:|2|dfs"}), describeDrives(out));
    EXPECT_TRUE(capture.contains(
        "PathHelper::reduceDriveList - element REMOVED: drive name: '/dfs:', type: 4, fs: 'dfs'\n"));
    EXPECT_TRUE(capture.contains(
        "PathHelper::reduceDriveList - element ADDED: drive name: '/dfs:', type: 2, fs: 'dfs'\n"));
    PathDrive remoteRoot(L"/x", true, DriveInfo(L"/x:", dtRemote, L"nfs"));
    out.clear();
    helper.reduceDriveList(drives, out, remoteRoot);
    EXPECT_EQ((Names{L"/:|2|ext4", L"/dfs:|4|dfs"}), describeDrives(out));
}

TEST(ReduceDriveList, SameTypeTakesTheRootsFileSystem) {
    std::vector<DriveInfo> drives{DriveInfo(L"/srv:", dtLocal, L"xfs"), DriveInfo(L"/srv:", dtLocal, L"ext4"),
                                  DriveInfo(L"/srv:", dtLocal, L"btrfs")};
    std::vector<DriveInfo> out;
    PathDrive root(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    PathHelper().reduceDriveList(drives, out, root);
    EXPECT_EQ((Names{L"/srv:|2|ext4"}), describeDrives(out));
    PathDrive xfsRoot(L"/", true, DriveInfo(L"/:", dtLocal, L"zfs"));
    out.clear();
    PathHelper().reduceDriveList(drives, out, xfsRoot);
    EXPECT_EQ((Names{L"/srv:|2|xfs"}), describeDrives(out));
}

TEST(BuildExcludeList, NfsHomeIsCutFromLocalRoot) {
    testsupport::TraceCapture capture;
    EXPECT_EQ((Names{L"/home|r"}), excludesFor({DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs")},
                                               PathDrive(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"))));
    EXPECT_TRUE(capture.contains("PathHelper::buildExcludeList - for path '/' (drive: '/:', type: 2, fs: 'ext4')"));
    EXPECT_TRUE(capture.contains("PathHelper::buildExcludeList [1] - excluded path for '/' is '/home'\n"));
}

TEST(BuildExcludeList, TracesTheLengthTestAndTheSubstringTestWhereTheyPass) {
    testsupport::TraceCapture capture;
    PathDrive root(L"/home", true, DriveInfo(L"/home:", dtLocal, L"ext4"));
    EXPECT_EQ((Names{L"/home/u|r"}),
              excludesFor({DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home2:", dtRemote, L"nfs"),
                           DriveInfo(L"/home/u:", dtRemote, L"nfs"), DriveInfo(L"/usr/local:", dtRemote, L"nfs")},
                          root));
    // "/" is not longer than the root: no length trace for it.
    EXPECT_FALSE(capture.contains("'tmpPathLen(5)<tmpDriveLen(1)'"));
    EXPECT_EQ(1u, capture.count("PathHelper::buildExcludeList - 'tmpPathLen(5)<tmpDriveLen(6)'\n"));
    EXPECT_EQ(1u, capture.count("PathHelper::buildExcludeList - 'tmpPathLen(5)<tmpDriveLen(7)'\n"));
    EXPECT_EQ(1u, capture.count("PathHelper::buildExcludeList - 'tmpPathLen(5)<tmpDriveLen(10)'\n"));
    // Only the drive that passes both the prefix and the separator checks.
    EXPECT_EQ(1u, capture.count(" is substring of "));
    EXPECT_TRUE(capture.contains("PathHelper::buildExcludeList - '/home' is substring of '/home/u'\n"))
        << capture.dump();
    EXPECT_TRUE(capture.contains("PathHelper::buildExcludeList [1] - excluded path for '/home' is '/home/u'\n"));
}

TEST(BuildExcludeList, SameFileSystemStaysInTheWalk) {
    PathDrive root(L"/", true, DriveInfo(L"/:", dtLocal, L"ext3"));
    EXPECT_EQ(Names{}, excludesFor({DriveInfo(L"/:", dtLocal, L"ext3"), DriveInfo(L"/boot:", dtLocal, L"ext3")}, root));
    EXPECT_EQ((Names{L"/boot|r"}),
              excludesFor({DriveInfo(L"/:", dtLocal, L"ext3"), DriveInfo(L"/boot:", dtLocal, L"xfs")}, root));
}

TEST(BuildExcludeList, SeparatorCheckKeepsSiblingsOut) {
    PathDrive root(L"/home", true, DriveInfo(L"/home:", dtLocal, L"ext4"));
    EXPECT_EQ(Names{}, excludesFor({DriveInfo(L"/home2:", dtRemote, L"nfs")}, root));
    EXPECT_EQ((Names{L"/home/u|r"}), excludesFor({DriveInfo(L"/home/u:", dtRemote, L"nfs")}, root));
    PathDrive slashRoot(L"/home/", true, DriveInfo(L"/home:", dtLocal, L"ext4"));
    EXPECT_EQ((Names{L"/home/u|r"}), excludesFor({DriveInfo(L"/home/u:", dtRemote, L"nfs")}, slashRoot));
}

TEST(BuildExcludeList, DriveEqualToTheRootGivesNothing) {
    PathDrive root(L"/home", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ(Names{}, excludesFor({DriveInfo(L"/home:", dtRemote, L"nfs")}, root));
    EXPECT_EQ(Names{}, excludesFor({DriveInfo(L"/usr:", dtRemote, L"nfs")}, root));
}

TEST(BuildExcludeList, ExcludedDriveOfSameKindIsStillCut) {
    DriveInfo boot(L"/boot:", dtLocal, L"ext4");
    boot.setExcludedDrive(true);
    PathDrive root(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    EXPECT_EQ((Names{L"/boot|r"}), excludesFor({DriveInfo(L"/:", dtLocal, L"ext4"), boot}, root));
}

TEST(BuildExcludeList, NestedMountsOfMixedKinds) {
    PathDrive root(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    // Ascending by drive name: "/home/local/remote:" sorts before "/home:".
    EXPECT_EQ((Names{L"/home/local/remote|r", L"/home|r", L"/proc|r"}),
              excludesFor({DriveInfo(L"/:", dtLocal, L"ext4"), DriveInfo(L"/home:", dtRemote, L"nfs"),
                           DriveInfo(L"/home/local:", dtLocal, L"ext4"),
                           DriveInfo(L"/home/local/remote:", dtRemote, L"nfs4"),
                           DriveInfo(L"/proc:", dtLocal, L"proc")},
                          root));
}

TEST(FillExclude, KeepsExcludesBelowTheRootOfEqualType) {
    std::vector<PathDrive> excludes{PathDrive(L"/usr/lib", true, DriveInfo(L"/:", dtLocal, L"ext4"))};
    PathDrive usr(L"/usr", true, DriveInfo(L"/usr:", dtLocal, L"xfs"));
    PathDrive var(L"/var", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    PathDrive remote(L"/usr", true, DriveInfo(L"/usr:", dtRemote, L"nfs"));
    PathHelper helper;
    std::vector<PathInfo> out;
    helper.fillExclude(usr, excludes, out);
    EXPECT_EQ((Names{L"/usr/lib|r"}), describe(out));
    out.clear();
    helper.fillExclude(var, excludes, out);
    EXPECT_TRUE(out.empty());
    helper.fillExclude(remote, excludes, out);
    EXPECT_TRUE(out.empty());
}

TEST(FillExclude, NoRepeatOrSeparatorCheckForFixedPaths) {
    std::vector<PathDrive> excludes{PathDrive(L"/usr2/x", false, DriveInfo(L"/:", dtLocal, L"ext4")),
                                    PathDrive(L"/usr2/x", false, DriveInfo(L"/:", dtLocal, L"ext4"))};
    PathDrive usr(L"/usr", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    std::vector<PathInfo> out;
    PathHelper().fillExclude(usr, excludes, out);
    EXPECT_EQ((Names{L"/usr2/x|n", L"/usr2/x|n"}), describe(out));
}

TEST(FillExclude, StarPathGoesToEveryRootOnce) {
    std::vector<PathDrive> excludes{PathDrive(L"*.tmp", true, DriveInfo(L"/:", dtLocal, L"ext4")),
                                    PathDrive(L"*.tmp", true, DriveInfo(L"/home:", dtRemote, L"nfs")),
                                    PathDrive(L"*", true, DriveInfo(L"/:", dtLocal, L"ext4"))};
    PathHelper helper;
    for (const wchar_t* rootPath : {L"/", L"/var", L"/home"}) {
        PathDrive root(rootPath, true, DriveInfo(L"/home:", dtRemote, L"nfs"));
        std::vector<PathInfo> out;
        helper.fillExclude(root, excludes, out);
        EXPECT_EQ((Names{L"*.tmp|r"}), describe(out)) << rootPath;
    }
    // Already present from an earlier step: not added again.
    std::vector<PathInfo> out{PathInfo(L"*.tmp", true)};
    PathDrive root(L"/", true, DriveInfo(L"/:", dtLocal, L"ext4"));
    helper.fillExclude(root, excludes, out);
    EXPECT_EQ((Names{L"*.tmp|r"}), describe(out));
}

TEST(FileSystemPathDriveListPruning, ErasesRefusedPathsWithTraces) {
    std::vector<PathDrive> list{PathDrive(L"/mnt/a/x", true, DriveInfo(L"/mnt/a:", dtLocal, L"ext4")),
                                PathDrive(L"/mnt/b", true, DriveInfo(L"/:", dtLocal, L"ext4")),
                                PathDrive(L"/usr", true, DriveInfo(L"/:", dtLocal, L"ext4"))};
    std::vector<PathInfo> included{PathInfo(L"/", true), PathInfo(L"/mnt/a", true)};
    std::vector<PathInfo> excluded{PathInfo(L"/mnt", true)};
    testsupport::TraceCapture capture;
    PathHelper().fileSystemPathDriveListPruning(list, included, excluded);
    ASSERT_EQ(2u, list.size());
    EXPECT_EQ(L"/mnt/a/x", str(list[0].getPathName()));
    EXPECT_EQ(L"/usr", str(list[1].getPathName()));
    EXPECT_TRUE(capture.contains("PathHelper::fileSystemPathDriveListPruning - entering [list size is 3]...\n"));
    EXPECT_TRUE(capture.contains("PathHelper::fileSystemPathDriveListPruning - path name '/mnt/b' removed!\n"));
    EXPECT_TRUE(capture.contains("PathHelper::fileSystemPathDriveListPruning - exit [list size is 2]\n"));
}
