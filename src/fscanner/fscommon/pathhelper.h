// Path lists, the query path resolver and the exclude lists of a scan root.
//
// All paths are wide strings with "/" as separator.  Strings returned as new
// blocks come from kelm_malloc and are released with kelm_free by the caller.
// Everything here runs on the query's thread and keeps no shared state; the
// working stores of the resolver are local to each call.
#ifndef FSCANNER_FSCOMMON_PATHHELPER_H
#define FSCANNER_FSCOMMON_PATHHELPER_H

#include <algorithm>
#include <map>
#include <set>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/utils.h"

class QvLogWrapper;

// Index of the entry of list that matches path by wildvcpathcmp (with the
// entry's recursive flag) and has the longest name; the first of equally long
// ones.  An entry with an empty or null name never wins.  -1 when none.
int checkPathListEx(const wchar_t* path, std::vector<PathInfo>& list, bool caseSensitive);

// The same over the entries whose drive type AND mask is not 0.
int checkPathDriveListEx(const wchar_t* path, std::vector<PathDrive>& list, unsigned int mask,
                         bool caseSensitive);

namespace utils {
// Inserts value at the upper bound of the sorted container, so that equal
// values keep their order of arrival.
template <class Container, class Value, class Less>
void insert_sorted(Container& container, const Value& value, Less less) {
    container.insert(std::upper_bound(container.begin(), container.end(), value, less), value);
}
}  // namespace utils

class PathHelper {
public:
    static constexpr wchar_t PathSeparator = utils::PathSeparator;

    // One row of the table of path variables.  The table holds only its end
    // row, named "__LAST_ENTRY__": no variable is defined.
    struct PathVariable {
        const wchar_t* name;
        int kind;
        const wchar_t* value;
    };
    static const PathVariable path_variables[];

    // Drive maps of the resolver: key getDriveKeyForMap / getPathDriveKeyForMap.
    typedef std::map<std::wstring, DriveInfo> DriveMap;
    typedef std::map<std::wstring, PathDrive> PathDriveMap;

    PathHelper();
    explicit PathHelper(int mode);

    // Copies in to out (size characters, end mark included).  A "%name%"
    // that names a known variable gives -1; unknown names stay as written,
    // a lone "%" is a plain character.  -1 for null arguments or size 0, -2
    // when out is too small, else 0.
    int expand_path_variable(wchar_t* in, wchar_t* out, unsigned int size);

    // Lexical absolute form of path: "." and ".." are settled, repeated "/"
    // dropped, a relative path is put behind the working directory.  With
    // followLinks, symbolic links are resolved (at most 32).  Null when the
    // narrow form is 4096 bytes or longer, on any failure of the system, or
    // when the result would not fit in 4095 bytes.  The caller frees the
    // result with kelm_free.
    wchar_t* realPath(const wchar_t* path, bool followLinks);
    // The same for a narrow path; the result is a narrow kelm_malloc block.
    char* realPath(const char* path, bool followLinks);

    // A path with a wildcard is copied as it is, any other goes through
    // realPath(in, false).  *out is a kelm_malloc block or null; true when it
    // is set.
    bool buildRealPath(wchar_t* in, wchar_t** out);
    // Wildcard paths are copied; the others are appended with their real
    // path and recursive flag, and dropped when that is null.
    void buildRealPath(std::vector<PathInfo>& in, std::vector<PathInfo>& out);

    // in's part before its first wildcard, through the "/" before it, with
    // any drive prefix kept: "/usr:/lib/*.so" gives "/usr:/lib/", "/usr:*.so"
    // gives "/usr:/".  out holds at least 4096 characters.
    void buildResolvedPath(const wchar_t* in, wchar_t* out);

    static std::wstring getDriveKeyForMap(std::wstring a, std::wstring b);
    // Drive name + file system.
    static std::wstring getDriveKeyForMap(const DriveInfo& drive);
    // Path + drive name + file system.
    static std::wstring getPathDriveKeyForMap(const PathDrive& pathDrive);

    // True when path may stay: the deepest excluded drive path that covers it
    // is no deeper than the deepest included one.  Anything up to the first
    // ":" of path is a drive prefix and is ignored.
    bool fileSystemPathChecker(const wchar_t* path, std::vector<PathInfo>& included,
                               std::vector<PathInfo>& excluded);

    // True when some drive name is a prefix of the path, ignoring case.
    bool pathLocation(PathInfo& path, std::vector<DriveInfo>& drives);
    // True when some entry's name equals the path's by wcscmp (recursive flag ignored).
    bool containsPathInfo(std::vector<PathInfo>& list, PathInfo& path);
    // Removes all but the last of each group of equal entries; true when
    // anything was removed.
    bool removePathListDuplicate(std::vector<PathInfo>& list);
    // Appends to out each entry of a with no equal entry in b.
    void differencePathList(std::vector<PathInfo>& a, std::vector<PathInfo>& b,
                            std::vector<PathInfo>& out);
    // Appends the path of each entry whose drive type AND mask is not 0.
    void extractPathList(std::vector<PathDrive>& in, unsigned int mask, std::vector<PathInfo>& out);
    // Appends each drive name less a trailing ":", recursive.
    void buildPathList(std::vector<DriveInfo>& drives, std::vector<PathInfo>& out);
    // Removes duplicates from dst, then appends src; with unique, entries
    // equal to one already in dst are skipped.
    void appendPathList(std::vector<PathInfo>& src, std::vector<PathInfo>& dst, bool unique);
    // Appends the entries of in that begin, ignoring case, with path's text
    // through its first ":".
    void pathFilterByDrive(PathInfo& path, std::vector<PathInfo>& in, std::vector<PathInfo>& out);

    // Turns query paths into (path, drive) pairs against driveList.  Returns 1.
    // parentResolved gets scan roots sorted by path, resolved the paths as
    // meant, unresolved what found no drive but names a valid one; excluded
    // is emptied.
    int pathResolver(std::vector<PathInfo>& pathList, std::vector<DriveInfo>& driveList,
                     std::vector<PathInfo>& includedDrivePaths,
                     std::vector<PathInfo>& excludedDrivePaths,
                     std::vector<PathDrive>& parentResolved, std::vector<PathDrive>& resolved,
                     std::vector<PathDrive>& excluded, std::vector<PathDrive>& unresolved,
                     unsigned int mask);

    // in's path is "drive:name".  True when name lies on the drive or reaches
    // it by wildcard; then resolved is (name, recursive) and parentResolved
    // the deeper of name's fixed part and the drive's mount directory.
    bool unix_path_resolver(PathInfo& in, PathInfo& resolved, PathInfo& parentResolved);

    // True when a prefix of path, followed by a file system name, is a key of
    // driveMap and that drive's type meets mask.  File systems are tried in
    // ascending order and the first one with any hit decides.
    bool isValidPath(DriveMap& driveMap, std::set<std::wstring>& fileSystems, unsigned int mask,
                     const wchar_t* path, bool unused);

    bool containsPathDrive(PathDriveMap& map, PathDrive& pathDrive);

    // Appends in to out and reduces out: paths nested in one another on
    // drives of one kind collapse (to the shortest with keepShortest), and a
    // path on two drives of one kind stays on the deeper mount.
    void pathDriveAccumulator(std::vector<PathDrive>& in, std::vector<PathDrive>& out,
                              bool keepShortest);

    // Splits p's name into its levels, deepest first: "/usr/lib/x" gives
    // paths "/usr/lib/x", "/usr/lib", "/usr", "/" and names "x", "lib",
    // "usr", "/".  Every entry takes p's recursive flag.
    void pathReducer(PathInfo p, std::vector<PathInfo>& paths, std::vector<PathInfo>& names);

    // One drive per drive name, the one most like root's drive; out in
    // ascending order of name.
    void reduceDriveList(std::vector<DriveInfo>& in, std::vector<DriveInfo>& out, PathDrive& root);
    // Appends the mount directories below root that must not be walked as
    // part of it (other type or file system, or an excluded drive).
    void buildExcludeList(std::vector<DriveInfo>& drives, PathDrive& root, std::vector<PathInfo>& out);
    // Appends the query's exclude paths that bear on root.
    void fillExclude(PathDrive& root, std::vector<PathDrive>& excludes, std::vector<PathInfo>& out);
    // Erases every entry whose path fileSystemPathChecker refuses.
    void fileSystemPathDriveListPruning(std::vector<PathDrive>& list, std::vector<PathInfo>& included,
                                        std::vector<PathInfo>& excluded);

private:
    QvLogWrapper* log;
    int mode;
};

#endif
