// The query path resolver and the accumulator, against one fixture drive
// list:
//   "/:" local ext4, "/boot:" local ext4, "/home:" remote nfs,
//   "/usr:" local xfs, "/usr/lib/x:" local xfs, "/net:" remote autofs.
#include <gtest/gtest.h>

#include <unistd.h>

#include <cwchar>
#include <string>
#include <vector>

#include "fscanner/fscommon/pathhelper.h"
#include "support/testsupport.h"

namespace {

typedef std::vector<std::wstring> Names;

std::wstring str(const wchar_t* text) { return text ? std::wstring(text) : std::wstring(L"<null>"); }

std::vector<DriveInfo> fixtureDrives() {
    return {DriveInfo(L"/:", dtLocal, L"ext4"),    DriveInfo(L"/boot:", dtLocal, L"ext4"),
            DriveInfo(L"/home:", dtRemote, L"nfs"), DriveInfo(L"/usr:", dtLocal, L"xfs"),
            DriveInfo(L"/usr/lib/x:", dtLocal, L"xfs"), DriveInfo(L"/net:", dtRemote, L"autofs")};
}

// "path|r or n|drive" per entry.
Names describe(const std::vector<PathDrive>& list) {
    Names out;
    for (const PathDrive& p : list)
        out.push_back(str(p.getPathName()) + (p.getRecursive() ? L"|r|" : L"|n|") + str(p.getDriveName()));
    return out;
}

struct Resolution {
    std::vector<PathDrive> parentResolved, resolved, excluded, unresolved, roots;
};

// Runs the resolver as the driver does: drive paths from the given drive
// list (after pruning) against the full fixture list, then the accumulator.
Resolution resolve(std::vector<PathInfo> paths, unsigned int mask,
                   std::vector<DriveInfo> drives = fixtureDrives()) {
    PathHelper helper(1);
    std::vector<DriveInfo> all = fixtureDrives();
    std::vector<PathInfo> drivePaths, prunedDrivePaths, droppedDrivePaths;
    helper.buildPathList(all, drivePaths);
    helper.buildPathList(drives, prunedDrivePaths);
    helper.differencePathList(drivePaths, prunedDrivePaths, droppedDrivePaths);
    Resolution r;
    r.excluded.push_back(PathDrive(L"/stale", true, DriveInfo(L"/:", dtLocal, L"ext4")));
    EXPECT_EQ(1, helper.pathResolver(paths, drives, prunedDrivePaths, droppedDrivePaths, r.parentResolved,
                                     r.resolved, r.excluded, r.unresolved, mask));
    EXPECT_TRUE(r.excluded.empty());
    helper.pathDriveAccumulator(r.parentResolved, r.roots, true);
    return r;
}

Resolution resolveOne(const wchar_t* path, bool recursive, unsigned int mask = 27) {
    return resolve({PathInfo(path, recursive)}, mask);
}

}  // namespace

TEST(PathResolver, PlainPathResolvesOnEveryDriveItLiesOn) {
    Resolution r = resolveOne(L"/usr/lib", false);
    EXPECT_EQ((Names{L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"}), describe(r.resolved));
    EXPECT_EQ((Names{L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"}), describe(r.parentResolved));
    EXPECT_TRUE(r.unresolved.empty());
    EXPECT_EQ((Names{L"/usr/lib|n|/usr:"}), describe(r.roots));
}

TEST(PathResolver, NonRecursivePathDoesNotReachADeeperDrive) {
    Resolution r = resolveOne(L"/usr/lib", false);
    for (const PathDrive& p : r.resolved) EXPECT_NE(L"/usr/lib/x:", str(p.getDriveName()));
}

TEST(PathResolver, RecursivePathReachesDeeperDrivesByWildcard) {
    Resolution r = resolveOne(L"/usr/lib", true);
    EXPECT_EQ((Names{L"/usr/lib|r|/:", L"/usr/lib|r|/usr/lib/x:", L"/usr/lib|r|/usr:"}), describe(r.resolved));
    EXPECT_EQ((Names{L"/usr/lib|r|/:", L"/usr/lib|r|/usr:", L"/usr/lib/x|r|/usr/lib/x:"}),
              describe(r.parentResolved));
    EXPECT_EQ((Names{L"/usr/lib|r|/usr:"}), describe(r.roots));
}

TEST(PathResolver, RecursiveRootReachesEveryLocalMount) {
    Resolution r = resolveOne(L"/", true);
    EXPECT_EQ((Names{L"/|r|/:", L"/|r|/boot:", L"/|r|/usr/lib/x:", L"/|r|/usr:"}), describe(r.resolved));
    EXPECT_EQ((Names{L"/|r|/:", L"/boot|r|/boot:", L"/usr|r|/usr:", L"/usr/lib/x|r|/usr/lib/x:"}),
              describe(r.parentResolved));
    EXPECT_EQ((Names{L"/|r|/:", L"/usr|r|/usr:"}), describe(r.roots));
}

TEST(PathResolver, RemoteMediaTakesOnlyRemoteDrives) {
    Resolution r = resolveOne(L"$remote::/", true);
    EXPECT_EQ((Names{L"/|r|/home:", L"/|r|/net:"}), describe(r.resolved));
    EXPECT_EQ((Names{L"/home|r|/home:", L"/net|r|/net:"}), describe(r.parentResolved));
    EXPECT_EQ((Names{L"/home|r|/home:", L"/net|r|/net:"}), describe(r.roots));
}

TEST(PathResolver, MediaWordsIgnoreCase) {
    Resolution upper = resolveOne(L"$LOCAL::/usr", false);
    Resolution lower = resolveOne(L"$local::/usr", false);
    EXPECT_EQ((Names{L"/usr|n|/:", L"/usr|n|/usr:"}), describe(lower.resolved));
    EXPECT_EQ(describe(lower.resolved), describe(upper.resolved));
    EXPECT_EQ(describe(lower.parentResolved), describe(upper.parentResolved));
    EXPECT_EQ((Names{L"/home|n|/:", L"/home|n|/home:"}), describe(resolveOne(L"$All::/home", false).resolved));
}

TEST(PathResolver, DefaultMediaFollowsTheMask) {
    // Mask 31: "$all", so the remote drive takes part.
    EXPECT_EQ((Names{L"/home|r|/:", L"/home|r|/home:"}), describe(resolveOne(L"/home", true, 31).resolved));
    // Mask 4: "$remote".
    EXPECT_EQ((Names{L"/home|r|/home:"}), describe(resolveOne(L"/home", true, 4).resolved));
    // Mask 27: "$local".
    EXPECT_EQ((Names{L"/home|r|/:"}), describe(resolveOne(L"/home", true, 27).resolved));
    // Mask 0: "$other", an empty group.
    Resolution none = resolveOne(L"/home", true, 0);
    EXPECT_TRUE(none.resolved.empty());
    EXPECT_TRUE(none.unresolved.empty());
}

TEST(PathResolver, OtherOrUnknownMediaResolvesNothing) {
    for (const wchar_t* path : {L"$other::/usr", L"$foo::/usr", L"$OTHER::/"}) {
        Resolution r = resolveOne(path, true);
        EXPECT_TRUE(r.resolved.empty()) << path;
        EXPECT_TRUE(r.parentResolved.empty()) << path;
        EXPECT_TRUE(r.unresolved.empty()) << path;
    }
}

TEST(PathResolver, NamedDriveOutsideMediaGoesToUnresolved) {
    testsupport::TraceCapture capture;
    Resolution r = resolveOne(L"$other::/usr:/usr", false);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_EQ((Names{L"/usr:/usr|n|<null>"}), describe(r.unresolved));
    EXPECT_TRUE(capture.contains("PathHelper::isValidPath")) << capture.dump();
    Resolution remote = resolveOne(L"$remote::/usr:/usr/lib", true);
    EXPECT_TRUE(remote.resolved.empty());
    EXPECT_EQ((Names{L"/usr:/usr/lib|r|<null>"}), describe(remote.unresolved));
}

TEST(PathResolver, NamedDriveTakesOnlyThatDrive) {
    Resolution r = resolveOne(L"/usr:/usr/lib", true);
    EXPECT_EQ((Names{L"/usr/lib|r|/usr:"}), describe(r.resolved));
    EXPECT_EQ((Names{L"/usr/lib|r|/usr:"}), describe(r.parentResolved));
    EXPECT_TRUE(r.unresolved.empty());
}

TEST(PathResolver, NamedDriveThatThePathMissesYieldsNothing) {
    Resolution r = resolveOne(L"/boot:/usr/lib", false);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.unresolved.empty());
}

TEST(PathResolver, NamedDriveIsFoundIgnoringCaseButTheDriveMapIsExact) {
    // checkDrive finds "/usr:" for "/USR:", but the validity test looks the
    // text up as written, so the path stays unresolved and names no drive.
    Resolution r = resolveOne(L"/USR:/usr/lib", false);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.unresolved.empty());
}

TEST(PathResolver, UnknownNamedDriveYieldsNothing) {
    Resolution r = resolveOne(L"/opt:/opt/x", false);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.unresolved.empty());
}

TEST(PathResolver, AnyDriveWordsAreTheSameAsNoDrive) {
    Names plain = describe(resolveOne(L"/boot", false).resolved);
    EXPECT_EQ((Names{L"/boot|n|/:", L"/boot|n|/boot:"}), plain);
    EXPECT_EQ(plain, describe(resolveOne(L"?:/boot", false).resolved));
    EXPECT_EQ(plain, describe(resolveOne(L"*:/boot", false).resolved));
    EXPECT_EQ((Names{L"/boot|n|/boot:"}), describe(resolveOne(L"*:/boot", false).roots));
}

TEST(PathResolver, GroupDriveRestrictsByKind) {
    Resolution local = resolveOne(L"$local:/usr", false);
    EXPECT_EQ((Names{L"/usr|n|/:", L"/usr|n|/usr:"}), describe(local.resolved));
    EXPECT_EQ((Names{L"/usr|n|/:", L"/usr|n|/usr:"}), describe(local.parentResolved));
    // Media and group drive are ANDed: "$local" media with a "$remote:" group is empty.
    Resolution none = resolveOne(L"$remote:/", true);
    EXPECT_TRUE(none.resolved.empty());
    EXPECT_TRUE(none.unresolved.empty());
    Resolution remote = resolveOne(L"$all::$REMOTE:/", true);
    EXPECT_EQ((Names{L"/|r|/home:", L"/|r|/net:"}), describe(remote.resolved));
}

TEST(PathResolver, UnknownGroupDriveHasMaskZero) {
    testsupport::TraceCapture capture;
    Resolution r = resolveOne(L"$foo:/usr", false);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.parentResolved.empty());
    // It went to the unresolved candidates, but "$foo:" names no drive.
    EXPECT_TRUE(r.unresolved.empty());
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - '$foo:' received on path: '/usr'\n")) << capture.dump();
}

TEST(PathResolver, WildcardPathsResolveOnTheirFixedPart) {
    Resolution r = resolveOne(L"/usr/lib/*.so", false);
    EXPECT_EQ((Names{L"/usr/lib/*.so|n|/:", L"/usr/lib/*.so|n|/usr/lib/x:", L"/usr/lib/*.so|n|/usr:"}),
              describe(r.resolved));
    EXPECT_EQ((Names{L"/usr/lib/|n|/:", L"/usr/lib/|n|/usr:", L"/usr/lib/x|n|/usr/lib/x:"}),
              describe(r.parentResolved));
}

TEST(PathResolver, LeadingStarReachesEveryDrive) {
    Resolution r = resolveOne(L"*.tmp", true, 31);
    EXPECT_EQ((Names{L"*.tmp|r|/:", L"*.tmp|r|/boot:", L"*.tmp|r|/home:", L"*.tmp|r|/net:",
                     L"*.tmp|r|/usr/lib/x:", L"*.tmp|r|/usr:"}),
              describe(r.resolved));
    EXPECT_EQ((Names{L"/|r|/:", L"/boot|r|/boot:", L"/home|r|/home:", L"/net|r|/net:", L"/usr|r|/usr:",
                     L"/usr/lib/x|r|/usr/lib/x:"}),
              describe(r.parentResolved));
}

TEST(PathResolver, WildcardNotAtTheStartIsNeverResolved) {
    Resolution r = resolveOne(L"foo*", true);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.parentResolved.empty());
    EXPECT_TRUE(r.unresolved.empty());
}

TEST(PathResolver, RelativePathIsMadeAbsoluteFirst) {
    char buffer[4096];
    ASSERT_NE(nullptr, getcwd(buffer, sizeof(buffer)));
    std::string cwd(buffer);
    std::wstring expected = std::wstring(cwd.begin(), cwd.end()) + L"/foo";
    Resolution r = resolve({PathInfo(L"foo", false)}, 31);
    ASSERT_FALSE(r.resolved.empty());
    for (const PathDrive& p : r.resolved) EXPECT_EQ(expected, str(p.getPathName()));
}

TEST(PathResolver, DotsAreSettledLexically) {
    Resolution r = resolveOne(L"/usr/share/../lib/./", true);
    EXPECT_EQ((Names{L"/usr/lib|r|/:", L"/usr/lib|r|/usr/lib/x:", L"/usr/lib|r|/usr:"}), describe(r.resolved));
    Resolution named = resolveOne(L"/usr:/usr/./x/../lib", false);
    EXPECT_EQ((Names{L"/usr/lib|n|/usr:"}), describe(named.resolved));
}

TEST(PathResolver, SeveralPathsAreMergedAndRepeatsDropped) {
    Resolution r = resolve({PathInfo(L"/boot", true), PathInfo(L"/usr", true), PathInfo(L"?:/boot", true)}, 27);
    // resolved follows the candidate keys (path, drive, file system).
    EXPECT_EQ((Names{L"/boot|r|/:", L"/usr|r|/:", L"/boot|r|/boot:", L"/usr|r|/usr/lib/x:", L"/usr|r|/usr:"}),
              describe(r.resolved));
    EXPECT_EQ((Names{L"/boot|r|/:", L"/boot|r|/boot:", L"/usr|r|/:", L"/usr|r|/usr:",
                     L"/usr/lib/x|r|/usr/lib/x:"}),
              describe(r.parentResolved));
    EXPECT_EQ((Names{L"/boot|r|/boot:", L"/usr|r|/usr:"}), describe(r.roots));
}

TEST(PathResolver, PrunedDriveYieldsNoCandidateAndNoParent) {
    std::vector<DriveInfo> pruned = fixtureDrives();
    pruned.erase(pruned.begin() + 3);  // "/usr:" dropped by its file system
    Resolution r = resolve({PathInfo(L"/usr/share", true)}, 27, pruned);
    EXPECT_EQ((Names{L"/usr/share|r|/:"}), describe(r.resolved));
    EXPECT_TRUE(r.parentResolved.empty());
    // A deeper included drive rescues its own subtree.
    Resolution deeper = resolve({PathInfo(L"/usr/lib", true)}, 27, pruned);
    EXPECT_EQ((Names{L"/usr/lib/x|r|/usr/lib/x:"}), describe(deeper.parentResolved));
}

TEST(PathResolver, TracesEachPathAndItsDrive) {
    testsupport::TraceCapture capture;
    resolveOne(L"/usr/./lib", false);
    EXPECT_TRUE(capture.contains(
        "PathHelper::pathResolver - NEXT path, media: '$local', pathName: '/usr/./lib', recursive: 'false'\n"))
        << capture.dump();
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - real pathName is: '/usr/lib'\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - pathName without driver: '/usr/lib', drive: ''\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - drive is '?:'\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - searchPath is '?:/usr/lib'\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - driveList[3] is '/usr:', type: 2, fs: 'xfs'\n"));
    EXPECT_TRUE(capture.contains("PathHelper::unix_path_resolver - path to resolve is '/usr:/usr/lib'\n"));
    EXPECT_TRUE(capture.contains("PathHelper::unix_path_resolver - not resolved!\n"));
}

TEST(PathResolver, PathWithUnexpandableVariableSyntaxIsDroppedWhenTooLong) {
    std::wstring tooLong = L"/" + std::wstring(5000, L'a');
    Resolution r = resolve({PathInfo(tooLong.c_str(), true), PathInfo(nullptr, true)}, 27);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.unresolved.empty());
}

// --- unix_path_resolver ---------------------------------------------------------

TEST(UnixPathResolver, RootOfTheScanIsTheDeeperOfPathAndMount) {
    PathHelper helper;
    PathInfo resolved, parent;
    PathInfo onHome(L"/home:/", true);
    ASSERT_TRUE(helper.unix_path_resolver(onHome, resolved, parent));
    EXPECT_EQ(L"/", str(resolved.getPathName()));
    EXPECT_EQ(L"/home", str(parent.getPathName()));
    EXPECT_TRUE(parent.getRecursive());
    PathInfo onRoot(L"/:/usr/lib", true);
    ASSERT_TRUE(helper.unix_path_resolver(onRoot, resolved, parent));
    EXPECT_EQ(L"/usr/lib", str(resolved.getPathName()));
    EXPECT_EQ(L"/usr/lib", str(parent.getPathName()));
}

TEST(UnixPathResolver, PrefixTestHasNoSeparatorCheck) {
    PathHelper helper;
    PathInfo resolved, parent;
    PathInfo sibling(L"/usr:/usr2/x", false);
    ASSERT_TRUE(helper.unix_path_resolver(sibling, resolved, parent));
    EXPECT_EQ(L"/usr2/x", str(resolved.getPathName()));
    PathInfo upper(L"/USR:/usr/x", false);
    EXPECT_TRUE(helper.unix_path_resolver(upper, resolved, parent));
}

TEST(UnixPathResolver, PathWithoutDriveOrOffTheDriveIsNotResolved) {
    PathHelper helper;
    PathInfo resolved(L"/keep", true), parent(L"/keep", true);
    PathInfo noDrive(L"/usr/lib", true);
    EXPECT_FALSE(helper.unix_path_resolver(noDrive, resolved, parent));
    PathInfo shallow(L"/usr/lib/x:/usr/lib", false);
    EXPECT_FALSE(helper.unix_path_resolver(shallow, resolved, parent));
    EXPECT_EQ(L"/keep", str(resolved.getPathName()));
}

// --- isValidPath ------------------------------------------------------------------

TEST(IsValidPath, MaskZeroRefusesAtOnce) {
    PathHelper helper;
    PathHelper::DriveMap map;
    map.insert(std::make_pair(std::wstring(L"/:ext4"), DriveInfo(L"/:", dtLocal, L"ext4")));
    std::set<std::wstring> fileSystems{L"ext4"};
    testsupport::TraceCapture capture;
    EXPECT_FALSE(helper.isValidPath(map, fileSystems, 0, L"/:/usr", false));
    EXPECT_FALSE(capture.messages().empty());
    EXPECT_TRUE(helper.isValidPath(map, fileSystems, 2, L"/:/usr", false));
    EXPECT_FALSE(helper.isValidPath(map, fileSystems, 4, L"/:/usr", false));
    EXPECT_FALSE(helper.isValidPath(map, fileSystems, 31, L"/usr", false));
}

TEST(IsValidPath, FirstFileSystemInOrderDecides) {
    PathHelper helper;
    PathHelper::DriveMap map;
    map.insert(std::make_pair(std::wstring(L"/x:aaa"), DriveInfo(L"/x:", dtRemote, L"aaa")));
    map.insert(std::make_pair(std::wstring(L"/x:/y:bbb"), DriveInfo(L"/x:/y:", dtLocal, L"bbb")));
    std::set<std::wstring> fileSystems{L"aaa", L"bbb"};
    // "bbb" would match the longer prefix as local, but "aaa" comes first.
    EXPECT_FALSE(helper.isValidPath(map, fileSystems, 2, L"/x:/y:/z", false));
    EXPECT_TRUE(helper.isValidPath(map, fileSystems, 4, L"/x:/y:/z", false));
}

// Every prefix of the path joined to each file system in turn and looked up,
// the longest first: the rule isValidPath answers, stated the plain way.
bool validByPrefixLookup(PathHelper::DriveMap& map, const std::set<std::wstring>& fileSystems, unsigned int mask,
                         const std::wstring& path) {
    if (mask == 0) return false;
    for (const std::wstring& fileSystem : fileSystems) {
        for (size_t length = path.size(); length > 0; --length) {
            auto hit = map.find(path.substr(0, length) + fileSystem);
            if (hit != map.end()) return (mask & hit->second.getDriveType()) != 0;
        }
    }
    return false;
}

TEST(IsValidPath, AgreesWithTheLookupOfEveryPrefixOnNestedAndOverlappingDrives) {
    // Keys whose prefix ends inside another key's file system name, file
    // system names that end one another ("fs", "xfs"), an empty name, drives
    // nested on drives, and paths shorter than some prefixes.
    const wchar_t* prefixes[] = {L"/:", L"/x:", L"/x:/y:", L"/x:/yy", L"/:/usr", L"/:/usr/lib", L"/:/usrx", L"/x"};
    const wchar_t* names[] = {L"fs", L"xfs", L"ext4", L"", L"s"};
    const DriveType types[] = {dtLocal, dtRemote, dtAutoFS, dtReserved8};
    std::set<std::wstring> fileSystems(std::begin(names), std::end(names));
    const wchar_t* paths[] = {L"/:/usr/lib/x", L"/:/usr", L"/:/usrx/a", L"/x:/y:/z", L"/x:/yy", L"/x:/y",
                              L"/x", L"/", L"", L"/:fs", L"/x:xfs/q", L"/:/usr/libxfs"};
    PathHelper helper;
    unsigned int seed = 7;
    for (int round = 0; round < 200; ++round) {
        PathHelper::DriveMap map;
        for (const wchar_t* prefix : prefixes)
            for (const wchar_t* name : names) {
                seed = seed * 1103515245u + 12345u;
                if ((seed >> 16) % 3 != 0) continue;
                DriveType type = types[(seed >> 8) % 4];
                map.insert(std::make_pair(std::wstring(prefix) + name, DriveInfo(prefix, type, name)));
            }
        std::set<std::wstring> some;
        for (const std::wstring& name : fileSystems) {
            seed = seed * 1103515245u + 12345u;
            if ((seed >> 16) % 4 != 0) some.insert(name);
        }
        for (size_t p = 0; p < sizeof paths / sizeof paths[0]; ++p)
            for (unsigned int mask : {1u, 2u, 4u, 8u, 27u, 31u, 0x3fu}) {
                EXPECT_EQ(validByPrefixLookup(map, some, mask, paths[p]),
                          helper.isValidPath(map, some, mask, paths[p], false))
                    << "round " << round << " path #" << p << " mask " << mask;
            }
    }
}

// --- pathDriveAccumulator -----------------------------------------------------------

namespace {

Names accumulate(std::vector<PathDrive> in, bool keepShortest) {
    std::vector<PathDrive> out;
    PathHelper().pathDriveAccumulator(in, out, keepShortest);
    return describe(out);
}

const DriveInfo rootExt4(L"/:", dtLocal, L"ext4");
const DriveInfo aExt4(L"/a:", dtLocal, L"ext4");
const DriveInfo bExt4(L"/b:", dtLocal, L"ext4");

}  // namespace

TEST(PathDriveAccumulator, KeepShortestKeepsTheOuterPathAndLaterOfTies) {
    EXPECT_EQ((Names{L"/usr|n|/:"}),
              accumulate({PathDrive(L"/usr/lib", true, rootExt4), PathDrive(L"/usr", false, rootExt4)}, true));
    EXPECT_EQ((Names{L"/usr|r|/:"}),
              accumulate({PathDrive(L"/usr", true, rootExt4), PathDrive(L"/usr/lib", false, rootExt4)}, true));
    EXPECT_EQ((Names{L"/x|n|/b:"}), accumulate({PathDrive(L"/x", true, aExt4), PathDrive(L"/x", false, bExt4)}, true));
    // No separator check: "/usr" absorbs "/usr2".
    EXPECT_EQ((Names{L"/usr|r|/:"}),
              accumulate({PathDrive(L"/usr", true, rootExt4), PathDrive(L"/usr2", true, rootExt4)}, true));
}

TEST(PathDriveAccumulator, DifferentKindsOrFileSystemsStayApart) {
    EXPECT_EQ((Names{L"/usr|r|/:", L"/usr/lib|r|/usr:"}),
              accumulate({PathDrive(L"/usr", true, rootExt4),
                          PathDrive(L"/usr/lib", true, DriveInfo(L"/usr:", dtLocal, L"xfs"))},
                         true));
    EXPECT_EQ((Names{L"/usr|r|/:", L"/usr/lib|r|/usr:"}),
              accumulate({PathDrive(L"/usr", true, rootExt4),
                          PathDrive(L"/usr/lib", true, DriveInfo(L"/usr:", dtRemote, L"ext4"))},
                         true));
}

TEST(PathDriveAccumulator, WithoutKeepShortestOnlyRecursiveOuterPathsAbsorb) {
    EXPECT_EQ((Names{L"/usr|r|/:"}),
              accumulate({PathDrive(L"/usr", true, rootExt4), PathDrive(L"/usr/lib", false, rootExt4)}, false));
    EXPECT_EQ((Names{L"/usr|n|/:", L"/usr/lib|r|/:"}),
              accumulate({PathDrive(L"/usr", false, rootExt4), PathDrive(L"/usr/lib", true, rootExt4)}, false));
    EXPECT_EQ((Names{L"/usr|r|/:"}),
              accumulate({PathDrive(L"/usr/lib", false, rootExt4), PathDrive(L"/usr", true, rootExt4)}, false));
    EXPECT_EQ((Names{L"/usr/lib|n|/:", L"/usr|n|/:"}),
              accumulate({PathDrive(L"/usr/lib", false, rootExt4), PathDrive(L"/usr", false, rootExt4)}, false));
    EXPECT_EQ((Names{L"/x|r|/b:"}), accumulate({PathDrive(L"/x", false, aExt4), PathDrive(L"/x", true, bExt4)}, false));
    EXPECT_EQ((Names{L"/x|r|/a:"}), accumulate({PathDrive(L"/x", true, aExt4), PathDrive(L"/x", true, bExt4)}, false));
}

TEST(PathDriveAccumulator, OnePathOnNestedDrivesStaysOnTheDeeperMount) {
    DriveInfo usr(L"/usr:", dtLocal, L"xfs");
    EXPECT_EQ((Names{L"/usr/lib|r|/usr:"}),
              accumulate({PathDrive(L"/usr/lib", true, usr), PathDrive(L"/usr/lib", true, rootExt4)}, true));
    EXPECT_EQ((Names{L"/usr/lib|r|/usr:"}),
              accumulate({PathDrive(L"/usr/lib", true, rootExt4), PathDrive(L"/usr/lib", true, usr)}, true));
    // Different kinds keep both.
    EXPECT_EQ((Names{L"/usr/lib|r|/:", L"/usr/lib|r|/usr:"}),
              accumulate({PathDrive(L"/usr/lib", true, rootExt4),
                          PathDrive(L"/usr/lib", true, DriveInfo(L"/usr:", dtRemote, L"nfs"))},
                         true));
}

TEST(PathDriveAccumulator, ExcludedDriveIsNotMergedByNesting) {
    std::vector<PathDrive> out;
    // Room for both, so no reallocation copies the entry (a copy starts
    // with the flag clear).
    out.reserve(4);
    out.push_back(PathDrive(L"/usr/lib", true, rootExt4));
    out[0].setExcludedDrive(true);
    std::vector<PathDrive> in{PathDrive(L"/usr", true, rootExt4)};
    PathHelper().pathDriveAccumulator(in, out, true);
    EXPECT_EQ((Names{L"/usr/lib|r|/:", L"/usr|r|/:"}), describe(out));
}

// --- one table over the fixture drive list ---------------------------------------------

namespace {

struct ResolverRow {
    const wchar_t* path;
    bool recursive;
    unsigned int mask;
    Names resolved;
    Names parentResolved;
    Names unresolved;
    Names roots;
};

}  // namespace

TEST(PathResolverTable, FixtureDriveList) {
    const std::vector<ResolverRow> rows = {
        {L"/usr/lib", false, 27, {L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"}, {L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"}, {},
         {L"/usr/lib|n|/usr:"}},
        {L"/usr/lib", true, 27,
         {L"/usr/lib|r|/:", L"/usr/lib|r|/usr/lib/x:", L"/usr/lib|r|/usr:"},
         {L"/usr/lib|r|/:", L"/usr/lib|r|/usr:", L"/usr/lib/x|r|/usr/lib/x:"}, {}, {L"/usr/lib|r|/usr:"}},
        {L"/", true, 27, {L"/|r|/:", L"/|r|/boot:", L"/|r|/usr/lib/x:", L"/|r|/usr:"},
         {L"/|r|/:", L"/boot|r|/boot:", L"/usr|r|/usr:", L"/usr/lib/x|r|/usr/lib/x:"}, {},
         {L"/|r|/:", L"/usr|r|/usr:"}},
        {L"/", false, 27, {L"/|n|/:"}, {L"/|n|/:"}, {}, {L"/|n|/:"}},
        {L"/", true, 31,
         {L"/|r|/:", L"/|r|/boot:", L"/|r|/home:", L"/|r|/net:", L"/|r|/usr/lib/x:", L"/|r|/usr:"},
         {L"/|r|/:", L"/boot|r|/boot:", L"/home|r|/home:", L"/net|r|/net:", L"/usr|r|/usr:",
          L"/usr/lib/x|r|/usr/lib/x:"},
         {},
         {L"/|r|/:", L"/home|r|/home:", L"/net|r|/net:", L"/usr|r|/usr:"}},
        {L"$remote::/", true, 27, {L"/|r|/home:", L"/|r|/net:"}, {L"/home|r|/home:", L"/net|r|/net:"}, {},
         {L"/home|r|/home:", L"/net|r|/net:"}},
        {L"$REMOTE::/home/u", false, 27, {L"/home/u|n|/home:"}, {L"/home/u|n|/home:"}, {}, {L"/home/u|n|/home:"}},
        {L"$other::/", true, 27, {}, {}, {}, {}},
        {L"$other::/usr:/usr", false, 27, {}, {}, {L"/usr:/usr|n|<null>"}, {}},
        {L"/usr:/usr/lib", true, 27, {L"/usr/lib|r|/usr:"}, {L"/usr/lib|r|/usr:"}, {}, {L"/usr/lib|r|/usr:"}},
        {L"/boot:/usr", true, 27, {}, {}, {}, {}},
        {L"?:/boot", false, 27, {L"/boot|n|/:", L"/boot|n|/boot:"}, {L"/boot|n|/:", L"/boot|n|/boot:"}, {},
         {L"/boot|n|/boot:"}},
        {L"*:/boot", true, 27, {L"/boot|r|/:", L"/boot|r|/boot:"}, {L"/boot|r|/:", L"/boot|r|/boot:"}, {},
         {L"/boot|r|/boot:"}},
        {L"$local:/usr", false, 27, {L"/usr|n|/:", L"/usr|n|/usr:"}, {L"/usr|n|/:", L"/usr|n|/usr:"}, {},
         {L"/usr|n|/usr:"}},
        {L"$all::$remote:/home", true, 27, {L"/home|r|/home:"}, {L"/home|r|/home:"}, {}, {L"/home|r|/home:"}},
        {L"$foo:/usr", false, 27, {}, {}, {}, {}},
        {L"/usr/lib/*.so", false, 27,
         {L"/usr/lib/*.so|n|/:", L"/usr/lib/*.so|n|/usr/lib/x:", L"/usr/lib/*.so|n|/usr:"},
         {L"/usr/lib/|n|/:", L"/usr/lib/|n|/usr:", L"/usr/lib/x|n|/usr/lib/x:"}, {},
         {L"/usr/lib/|n|/usr:"}},
        {L"foo*", false, 27, {}, {}, {}, {}},
        {L"/usr/./share/../lib/", false, 27, {L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"},
         {L"/usr/lib|n|/:", L"/usr/lib|n|/usr:"}, {}, {L"/usr/lib|n|/usr:"}},
        {L"/../boot/.", true, 27, {L"/boot|r|/:", L"/boot|r|/boot:"}, {L"/boot|r|/:", L"/boot|r|/boot:"}, {},
         {L"/boot|r|/boot:"}},
    };
    for (const ResolverRow& row : rows) {
        Resolution r = resolveOne(row.path, row.recursive, row.mask);
        const std::string label(row.path, row.path + wcslen(row.path));
        EXPECT_EQ(row.resolved, describe(r.resolved)) << label;
        EXPECT_EQ(row.parentResolved, describe(r.parentResolved)) << label;
        EXPECT_EQ(row.unresolved, describe(r.unresolved)) << label;
        EXPECT_EQ(row.roots, describe(r.roots)) << label;
    }
}

TEST(PathResolver, UnknownGroupDriveGoesToTheUnresolvedCandidates) {
    // Mask 0 for "$foo:" means no drive is tried, so the path falls to the
    // unresolved candidates.  Whether it is reported there depends only on
    // the last stage: with a drive whose name is "$foo:" it is valid.
    std::vector<DriveInfo> drives = fixtureDrives();
    drives.push_back(DriveInfo(L"$foo:", dtLocal, L"ext4"));
    Resolution r = resolve({PathInfo(L"$foo:/usr", false)}, 27, drives);
    EXPECT_TRUE(r.resolved.empty());
    EXPECT_TRUE(r.parentResolved.empty());
    EXPECT_EQ((Names{L"$foo:/usr|n|<null>"}), describe(r.unresolved));
    // A known group word takes the drives instead and leaves nothing unresolved.
    Resolution known = resolve({PathInfo(L"$local:/usr", false)}, 27, drives);
    EXPECT_TRUE(known.unresolved.empty());
    EXPECT_FALSE(known.resolved.empty());
}

TEST(PathResolver, ListInfoIsTracedOnlyWhenLevelFourIsActive) {
    {
        testsupport::TraceCapture capture;
        resolveOne(L"/usr/lib", false);
        EXPECT_FALSE(capture.contains("PathHelper::pathResolver - list info...\n"));
        EXPECT_FALSE(capture.contains("PathHelper::pathResolver - resolved path ["));
    }
    testsupport::TraceCapture capture(4);
    std::vector<DriveInfo> drives = fixtureDrives();
    drives.push_back(DriveInfo(L"$foo:", dtLocal, L"ext4"));
    resolve({PathInfo(L"/usr/lib", false), PathInfo(L"$foo:/usr", true)}, 27, drives);
    EXPECT_EQ(1u, capture.count("PathHelper::pathResolver - list info...\n")) << capture.dump();
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - resolved path ['/usr/lib'] [2] ['/:']\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - resolved path ['/usr/lib'] [2] ['/usr:']\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - parent resolved path ['/usr/lib'] [2] ['/usr:']\n"));
    EXPECT_TRUE(capture.contains("PathHelper::pathResolver - unresolved path ['$foo:/usr'] ["));
    EXPECT_FALSE(capture.contains("PathHelper::pathResolver - excluded path ["));
    EXPECT_EQ(1u, capture.count("PathHelper::pathResolver - list info end\n"));
    // Every entry stands between the two marks.
    std::vector<QvLogWrapper::Message> messages = capture.messages();
    size_t begin = messages.size(), end = messages.size(), entries = 0, inside = 0;
    for (size_t i = 0; i < messages.size(); ++i) {
        if (messages[i].text == "PathHelper::pathResolver - list info...\n") begin = i;
        if (messages[i].text == "PathHelper::pathResolver - list info end\n") end = i;
    }
    ASSERT_LT(begin, end);
    for (size_t i = 0; i < messages.size(); ++i) {
        if (messages[i].text.find("path ['") == std::string::npos ||
            messages[i].text.find("PathHelper::pathResolver - ") != 0)
            continue;
        ++entries;
        if (i > begin && i < end) ++inside;
    }
    EXPECT_EQ(entries, inside);
    EXPECT_EQ(end - begin - 1, entries);
}
