#include "fscanner/fscommon/pathhelper.h"

#include <errno.h>
#include <unistd.h>

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <cwctype>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fscommon/drivehelper.h"
#include "fscanner/fscommon/resolvepath.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/wildcard.h"

const PathHelper::PathVariable PathHelper::path_variables[] = {
    {L"__LAST_ENTRY__", 0, nullptr},
};

namespace {

// Buffers of the path flow: 4096 characters, a path being at most 4095.
const size_t PATH_BUFFER = 4096;

const wchar_t* safe(const wchar_t* text) { return text ? text : L""; }

size_t safeLength(const wchar_t* text) { return text ? wcslen(text) : 0; }

bool isResolvableStart(wchar_t c) { return c == L'*' || c == L'?' || c == L'/'; }

// Path text without a leading "drive:" part.
const wchar_t* behindDrive(const wchar_t* path) {
    const wchar_t* colon = wcschr(path, L':');
    return colon ? colon + 1 : path;
}

// Index of the entry of list whose path covers path and is the longest of
// those that do, among the entries accept lets through; the first wins a
// tie, and an empty name never wins.  -1 for none or a null path.
template <typename Entry, typename Accept>
int longestCovering(const wchar_t* path, std::vector<Entry>& list, bool caseSensitive, Accept accept) {
    if (!path) return -1;
    int best = -1;
    size_t bestLength = 0;
    for (size_t i = 0; i < list.size(); ++i) {
        if (!accept(list[i])) continue;
        const wchar_t* name = list[i].getPathName();
        size_t length = safeLength(name);
        if (length <= bestLength) continue;
        if (wildvcpathcmp(name, path, list[i].getRecursive(), caseSensitive)) {
            best = static_cast<int>(i);
            bestLength = length;
        }
    }
    return best;
}

// True when list holds an entry equal to path.
bool holds(const std::vector<PathInfo>& list, const PathInfo& path) {
    return std::find(list.begin(), list.end(), path) != list.end();
}

// Traces every entry of one of the resolver's lists, named by what
// ("resolved", "excluded", ...), on behalf of function.
void traceResolverList(QvLogWrapper* log, const char* function, const char* what,
                       const std::vector<PathDrive>& entries) {
    for (const PathDrive& entry : entries)
        log->traceMAX(__LINE__, __FILE__, function,
                      "PathHelper::pathResolver - %s path ['%S'] [%d] ['%S']\n", what,
                      safe(entry.getPathName()), static_cast<int>(entry.getDriveType()),
                      safe(entry.getDriveName()));
}

}  // namespace

// --- free functions -------------------------------------------------------

int checkPathListEx(const wchar_t* path, std::vector<PathInfo>& list, bool caseSensitive) {
    return longestCovering(path, list, caseSensitive, [](const PathInfo&) { return true; });
}

int checkPathDriveListEx(const wchar_t* path, std::vector<PathDrive>& list, unsigned int mask,
                         bool caseSensitive) {
    return longestCovering(path, list, caseSensitive,
                           [mask](const PathDrive& entry) { return (entry.getDriveType() & mask) != 0; });
}

// --- PathHelper: construction and plain path work -------------------------

PathHelper::PathHelper() : log(getQvLogFs()), mode(1) {}

PathHelper::PathHelper(int value) : log(getQvLogFs()), mode(value) {}

int PathHelper::expand_path_variable(wchar_t* in, wchar_t* out, unsigned int size) {
    if (!in || !out || size == 0) return -1;
    size_t written = 0;
    // Appends count characters of text, keeping room for the end mark.
    auto put = [&](const wchar_t* text, size_t count) -> bool {
        if (written + count >= size) return false;
        wmemcpy(out + written, text, count);
        written += count;
        return true;
    };
    size_t turn = 0;
    for (const wchar_t* p = in; *p;) {
        if (++turn % CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_SMALL == 0) CpuThreshold::doIteration();
        if (*p != L'%') {
            if (!put(p, 1)) return -2;
            ++p;
            continue;
        }
        const wchar_t* close = wcschr(p + 1, L'%');
        if (!close) {  // a lone "%" is a plain character
            if (!put(p, 1)) return -2;
            ++p;
            continue;
        }
        size_t nameLength = static_cast<size_t>(close - (p + 1));
        for (const PathVariable* row = path_variables; wcscmp(row->name, L"__LAST_ENTRY__") != 0; ++row) {
            if (wcsncmp(row->name, p + 1, nameLength) == 0) return -1;
        }
        // Unknown names stay as written, both "%" signs included.
        if (!put(p, nameLength + 2)) return -2;
        p = close + 1;
    }
    out[written] = L'\0';
    return 0;
}

wchar_t* PathHelper::realPath(const wchar_t* path, bool followLinks) {
    return resolvePath(path, followLinks);
}

char* PathHelper::realPath(const char* path, bool followLinks) {
    return resolvePath(path, followLinks);
}

bool PathHelper::buildRealPath(wchar_t* in, wchar_t** out) {
    if (!out) return false;
    *out = nullptr;
    if (!in) return false;
    if (checkWildCard(in))
        *out = wideDuplicate(in);
    else
        *out = realPath(in, false);
    return *out != nullptr;
}

void PathHelper::buildRealPath(std::vector<PathInfo>& in, std::vector<PathInfo>& out) {
    for (PathInfo& path : in) {
        wchar_t* name = path.getPathName();
        if (!name) continue;
        if (checkWildCard(name)) {
            out.push_back(path);
            continue;
        }
        wchar_t* real = realPath(name, false);
        if (!real) continue;
        out.push_back(PathInfo(real, path.getRecursive()));
        kelm_free(real);
    }
}

void PathHelper::buildResolvedPath(const wchar_t* in, wchar_t* out) {
    if (!out) return;
    out[0] = L'\0';
    if (!in) return;
    std::wstring text(in);
    size_t colon = text.find(L':');
    size_t restStart = colon == std::wstring::npos ? 0 : colon + 1;
    std::wstring result;
    size_t wildcard = text.find_first_of(L"*?", restStart);
    if (wildcard == std::wstring::npos) {
        result = text;
    } else {
        size_t slash = text.rfind(L'/', wildcard);
        if (slash != std::wstring::npos && slash >= restStart)
            result = text.substr(0, slash + 1);
        else
            result = text.substr(0, restStart) + L"/";
    }
    if (result.size() >= PATH_BUFFER) result.erase(PATH_BUFFER - 1);
    wmemcpy(out, result.c_str(), result.size() + 1);
}

std::wstring PathHelper::getDriveKeyForMap(std::wstring a, std::wstring b) { return a + b; }

std::wstring PathHelper::getDriveKeyForMap(const DriveInfo& drive) {
    return getDriveKeyForMap(safe(drive.getDriveName()), safe(drive.getDriveFileSystem()));
}

std::wstring PathHelper::getPathDriveKeyForMap(const PathDrive& pathDrive) {
    return std::wstring(safe(pathDrive.getPathName())) + safe(pathDrive.getDriveName()) +
           safe(pathDrive.getDriveFileSystem());
}

bool PathHelper::fileSystemPathChecker(const wchar_t* path, std::vector<PathInfo>& included,
                                       std::vector<PathInfo>& excluded) {
    if (!path) return false;
    const wchar_t* name = behindDrive(path);
    int x = checkPathListEx(name, excluded, true);
    if (x < 0) return true;
    int n = checkPathListEx(name, included, true);
    if (n < 0) return false;
    // The deepest mount decides: an included drive nested in an excluded one
    // rescues its subtree.
    return safeLength(excluded[x].getPathName()) <= safeLength(included[n].getPathName());
}

bool PathHelper::pathLocation(PathInfo& path, std::vector<DriveInfo>& drives) {
    const wchar_t* name = path.getPathName();
    if (!name) return false;
    for (const DriveInfo& drive : drives) {
        const wchar_t* driveName = drive.getDriveName();
        if (driveName && wcsncasecmp(driveName, name, wcslen(driveName)) == 0) return true;
    }
    return false;
}

bool PathHelper::containsPathInfo(std::vector<PathInfo>& list, PathInfo& path) {
    for (const PathInfo& entry : list) {
        const wchar_t* a = entry.getPathName();
        const wchar_t* b = path.getPathName();
        if ((!a && !b) || (a && b && wcscmp(a, b) == 0)) return true;
    }
    return false;
}

bool PathHelper::removePathListDuplicate(std::vector<PathInfo>& list) {
    bool removed = false;
    for (size_t i = 0; i < list.size();) {
        bool erased = false;
        for (size_t j = i + 1; j < list.size(); ++j) {
            if (list[i] == list[j]) {
                // The last of a group of equals stays, at its own place.
                list.erase(list.begin() + static_cast<std::ptrdiff_t>(i));
                erased = removed = true;
                break;
            }
        }
        if (!erased) ++i;
    }
    return removed;
}

void PathHelper::differencePathList(std::vector<PathInfo>& a, std::vector<PathInfo>& b,
                                    std::vector<PathInfo>& out) {
    for (const PathInfo& entry : a) {
        if (!holds(b, entry)) out.push_back(entry);
    }
}

void PathHelper::extractPathList(std::vector<PathDrive>& in, unsigned int mask, std::vector<PathInfo>& out) {
    for (const PathDrive& entry : in) {
        if ((entry.getDriveType() & mask) != 0) out.push_back(static_cast<const PathInfo&>(entry));
    }
}

void PathHelper::buildPathList(std::vector<DriveInfo>& drives, std::vector<PathInfo>& out) {
    for (const DriveInfo& drive : drives) {
        std::wstring name(safe(drive.getDriveName()));
        if (!name.empty() && name[name.size() - 1] == L':') name.erase(name.size() - 1);
        out.push_back(PathInfo(name.c_str(), true));
    }
}

void PathHelper::appendPathList(std::vector<PathInfo>& src, std::vector<PathInfo>& dst, bool unique) {
    removePathListDuplicate(dst);
    for (const PathInfo& entry : src) {
        if (unique && holds(dst, entry)) continue;
        dst.push_back(entry);
    }
}

void PathHelper::pathFilterByDrive(PathInfo& path, std::vector<PathInfo>& in, std::vector<PathInfo>& out) {
    const wchar_t* name = path.getPathName();
    if (!name) return;
    const wchar_t* colon = wcschr(name, L':');
    size_t length = colon ? static_cast<size_t>(colon - name) + 1 : wcslen(name);
    for (const PathInfo& entry : in) {
        const wchar_t* text = entry.getPathName();
        if (text && wcslen(text) >= length && wcsncasecmp(text, name, length) == 0) out.push_back(entry);
    }
}

// --- resolver ---------------------------------------------------------------

bool PathHelper::isValidPath(DriveMap& driveMap, std::set<std::wstring>& fileSystems, unsigned int mask,
                             const wchar_t* path, bool) {
    if (mask == 0) {
        log->traceMAX(__LINE__, __FILE__, __func__,
                      "PathHelper::isValidPath - mask is 0, path '%S' is not valid\n", safe(path));
        return false;
    }
    if (!path) return false;
    // File systems are the outer loop: the first one in order with any
    // matching prefix decides, even if a later one would match a longer one.
    // Within one file system the longest prefix wins.  The drive keys are
    // few and the path long, so each key is split into prefix and file
    // system and compared with the path, rather than every prefix of the path
    // being joined to the file system and looked up: the same answer with no
    // string built per try (this runs for every candidate of every query).
    size_t pathLength = wcslen(path);
    for (const std::wstring& fileSystem : fileSystems) {
        DriveInfo* best = nullptr;
        size_t bestLength = 0;
        for (DriveMap::value_type& entry : driveMap) {
            const std::wstring& key = entry.first;
            if (key.size() <= fileSystem.size()) continue;
            size_t prefixLength = key.size() - fileSystem.size();
            if (prefixLength > pathLength || prefixLength <= bestLength) continue;
            if (key.compare(prefixLength, std::wstring::npos, fileSystem) != 0) continue;
            if (wmemcmp(key.data(), path, prefixLength) != 0) continue;
            best = &entry.second;
            bestLength = prefixLength;
        }
        if (best != nullptr) return (mask & best->getDriveType()) != 0;
    }
    return false;
}

bool PathHelper::containsPathDrive(PathDriveMap& map, PathDrive& pathDrive) {
    return map.find(getPathDriveKeyForMap(pathDrive)) != map.end();
}

bool PathHelper::unix_path_resolver(PathInfo& in, PathInfo& resolved, PathInfo& parentResolved) {
    std::wstring target(safe(in.getPathName()));
    if (in.getRecursive()) {
        if (target.empty() || target[target.size() - 1] != L'/') target += L'/';
        target += L'*';
    }
    log->traceMAX(__LINE__, __FILE__, __func__,
                  "PathHelper::unix_path_resolver - path to resolve is '%S'\n", target.c_str());
    size_t colon = target.find(L':');
    if (colon == std::wstring::npos) {
        log->traceMAX(__LINE__, __FILE__, __func__, "PathHelper::unix_path_resolver - not resolved!\n");
        return false;
    }
    std::wstring tmpDrive = target.substr(0, colon);
    std::wstring tmpPathName = target.substr(colon + 1);
    std::wstring own(safe(in.getPathName()));
    size_t ownColon = own.find(L':');
    std::wstring drive = own.substr(0, ownColon);
    std::wstring name = own.substr(ownColon + 1);

    // A prefix test with no check of the separator: "/usr2/x" lies on "/usr:".
    bool onDrive = wcsncasecmp(tmpPathName.c_str(), tmpDrive.c_str(), tmpDrive.size()) == 0 &&
                   tmpPathName.size() >= tmpDrive.size();
    if (!onDrive && !wildcasecmp(tmpPathName.c_str(), tmpDrive.c_str(), true)) {
        log->traceMAX(__LINE__, __FILE__, __func__, "PathHelper::unix_path_resolver - not resolved!\n");
        return false;
    }
    resolved = PathInfo(name.c_str(), in.getRecursive());
    std::vector<wchar_t> fixed(PATH_BUFFER, L'\0');
    buildResolvedPath(name.c_str(), fixed.data());
    if (wcslen(fixed.data()) < drive.size())
        parentResolved = PathInfo(drive.c_str(), in.getRecursive());
    else
        parentResolved = PathInfo(fixed.data(), in.getRecursive());
    return true;
}

int PathHelper::pathResolver(std::vector<PathInfo>& pathList, std::vector<DriveInfo>& driveList,
                             std::vector<PathInfo>& includedDrivePaths,
                             std::vector<PathInfo>& excludedDrivePaths,
                             std::vector<PathDrive>& parentResolved, std::vector<PathDrive>& resolved,
                             std::vector<PathDrive>& excluded, std::vector<PathDrive>& unresolved,
                             unsigned int mask) {
    DriveMap driveMap;
    std::set<std::wstring> fileSystems;
    for (const DriveInfo& drive : driveList) {
        if (!drive.getDriveName() || !drive.getDriveFileSystem()) continue;
        // The later of two drives with one name and file system (the twins of
        // a "dfs" mount) takes the key: the local twin.
        DriveMap::iterator at = driveMap.find(getDriveKeyForMap(drive));
        if (at == driveMap.end())
            driveMap.insert(std::make_pair(getDriveKeyForMap(drive), drive));
        else
            at->second = drive;
        fileSystems.insert(drive.getDriveFileSystem());
    }
    PathDriveMap candidates;
    std::vector<PathDrive> unresolvedCandidates;

    const wchar_t* defaultMedia = mask == mdRemoteDriveGroup  ? L"$remote"
                                  : mask == mdAllDrives       ? L"$all"
                                  : mask == mdOtherDriveGroup ? L"$other"
                                                              : L"$local";
    std::vector<wchar_t> buffer(PATH_BUFFER, L'\0');
    std::vector<wchar_t> specBuffer(PATH_BUFFER, L'\0');
    std::vector<wchar_t> fixed(PATH_BUFFER, L'\0');

    // Stage 1: one candidate per drive that the path may lie on.
    size_t turn = 0;
    for (PathInfo& path : pathList) {
        if (++turn % CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_SMALL == 0) CpuThreshold::doIteration();
        const bool recursive = path.getRecursive();
        if (expand_path_variable(path.getPathName(), buffer.data(), PATH_BUFFER) != 0) continue;

        std::wstring text(buffer.data());
        std::wstring media;
        std::wstring pathText;
        size_t separator = text.find(L"::");
        if (separator == std::wstring::npos) {
            media = defaultMedia;
            pathText = text;
        } else {
            media = text.substr(0, separator);
            pathText = text.substr(separator + 2);
        }
        log->traceMID(__LINE__, __FILE__, __func__,
                      "PathHelper::pathResolver - NEXT path, media: '%S', pathName: '%S', recursive: '%s'\n",
                      media.c_str(), pathText.c_str(), recursive ? "true" : "false");
        unsigned int mediaMask = mdOtherDriveGroup;
        if (wcscasecmp(media.c_str(), L"$local") == 0)
            mediaMask = mdLocalDriveGroup;
        else if (wcscasecmp(media.c_str(), L"$remote") == 0)
            mediaMask = mdRemoteDriveGroup;
        else if (wcscasecmp(media.c_str(), L"$all") == 0)
            mediaMask = mdAllDrives;

        std::wstring drive;
        std::wstring name;
        size_t colon = pathText.find(L':');
        if (colon == std::wstring::npos) {
            name = pathText;
        } else {
            drive = pathText.substr(0, colon + 1);
            name = pathText.substr(colon + 1);
        }

        // Lexical only: symbolic links in query paths are not followed.
        wchar_t* real = nullptr;
        if (buildRealPath(const_cast<wchar_t*>(name.c_str()), &real)) {
            name = real;
            pathText = drive + name;
            log->traceMID(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - real pathName is: '%S'\n",
                          name.c_str());
        }
        kelm_free(real);
        log->traceMID(__LINE__, __FILE__, __func__,
                      "PathHelper::pathResolver - pathName without driver: '%S', drive: '%S'\n", name.c_str(),
                      drive.c_str());

        bool added = false;
        const bool resolvable = !name.empty() && isResolvableStart(name[0]);
        auto addCandidate = [&](const std::wstring& search, const DriveInfo& onDrive) {
            PathDrive candidate(search.c_str(), recursive, onDrive);
            candidates.insert(std::make_pair(getPathDriveKeyForMap(candidate), candidate));
            added = true;
        };

        if (!drive.empty() && drive[0] == L'$') {
            unsigned int driveMask = mdOtherDriveGroup;
            if (wcscasecmp(drive.c_str(), L"$local:") == 0)
                driveMask = mdLocalDriveGroup;
            else if (wcscasecmp(drive.c_str(), L"$remote:") == 0)
                driveMask = mdRemoteDriveGroup;
            else if (wcscasecmp(drive.c_str(), L"$all:") == 0)
                driveMask = mdAllDrives;
            log->traceMID(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - '%S' received on path: '%S'\n",
                          drive.c_str(), name.c_str());
            if (resolvable) {
                for (const DriveInfo& d : driveList) {
                    if ((mediaMask & d.getDriveType() & driveMask) == 0 || !d.getDriveName()) continue;
                    std::wstring search(d.getDriveName());
                    if (name[0] != L'/') search += L'/';
                    search += name;
                    if (isValidPath(driveMap, fileSystems, mdAllDrives, search.c_str(), false)) addCandidate(search, d);
                }
            }
        } else if (resolvable) {
            if (drive.empty()) {
                drive = L"?:";
                if (pathText.size() < PATH_BUFFER) {
                    wmemcpy(specBuffer.data(), pathText.c_str(), pathText.size() + 1);
                    if (wcs_stringCat(const_cast<wchar_t*>(L"?:"), specBuffer.data(), PATH_BUFFER) == 1)
                        pathText = specBuffer.data();
                    else
                        pathText = drive + pathText;
                } else {
                    pathText = drive + pathText;
                }
                log->traceMID(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - drive is '%S'\n",
                              drive.c_str());
            }
            if (drive != L"?:" && drive != L"*:") {
                // Drive names in query paths never depend on case.
                buildResolvedPath(pathText.c_str(), fixed.data());
                std::wstring fixedText(fixed.data());
                size_t fixedColon = fixedText.find(L':');
                std::wstring driveText = fixedText.substr(0, fixedColon == std::wstring::npos ? fixedText.size()
                                                                                              : fixedColon + 1);
                DriveHelper driveHelper;
                int index = driveHelper.checkDrive(driveList, driveText.c_str(), false);
                if (index >= 0 && isValidPath(driveMap, fileSystems, mediaMask, pathText.c_str(), false))
                    addCandidate(pathText, driveList[static_cast<size_t>(index)]);
            } else {
                log->traceMID(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - searchPath is '%S'\n",
                              pathText.c_str());
                std::wstring rest = pathText.substr(pathText.find(L':') + 1);
                for (size_t i = 0; i < driveList.size(); ++i) {
                    const DriveInfo& d = driveList[i];
                    log->traceMAX(__LINE__, __FILE__, __func__,
                                  "PathHelper::pathResolver - driveList[%d] is '%S', type: %d, fs: '%S'\n",
                                  static_cast<int>(i), safe(d.getDriveName()), static_cast<int>(d.getDriveType()),
                                  safe(d.getDriveFileSystem()));
                    if ((mediaMask & d.getDriveType()) == 0 || !d.getDriveName()) continue;
                    std::wstring driveName(d.getDriveName());
                    size_t driveColon = driveName.find(L':');
                    std::wstring search =
                        driveName.substr(0, driveColon == std::wstring::npos ? driveName.size() : driveColon + 1) +
                        rest;
                    if (isValidPath(driveMap, fileSystems, mediaMask, search.c_str(), false))
                        addCandidate(search, d);
                }
            }
        }
        if (!added) unresolvedCandidates.push_back(PathDrive(pathText.c_str(), recursive, DriveInfo()));
    }

    // Stage 2: keep the candidates whose path truly reaches their drive.
    PathDriveMap seenResolved;
    PathDriveMap seenParents;
    auto byPathName = [](const PathDrive& a, const PathDrive& b) {
        return wcscmp(safe(a.getPathName()), safe(b.getPathName())) < 0;
    };
    for (PathDriveMap::iterator it = candidates.begin(); it != candidates.end(); ++it) {
        CpuThreshold::doIteration();
        if (!isValidPath(driveMap, fileSystems, mdAllDrives, it->first.c_str(), false)) continue;
        PathInfo resolvedPath;
        PathInfo parentPath;
        if (!unix_path_resolver(it->second, resolvedPath, parentPath)) continue;
        const DriveInfo& drive = it->second;
        PathDrive resolvedPair(resolvedPath, drive);
        std::wstring key = getPathDriveKeyForMap(resolvedPair);
        if (seenResolved.find(key) == seenResolved.end()) {
            seenResolved.insert(std::make_pair(key, resolvedPair));
            resolved.push_back(resolvedPair);
        }
        if (fileSystemPathChecker(parentPath.getPathName(), includedDrivePaths, excludedDrivePaths)) {
            PathDrive parentPair(parentPath, drive);
            std::wstring parentKey = getPathDriveKeyForMap(parentPair);
            if (seenParents.find(parentKey) == seenParents.end()) {
                seenParents.insert(std::make_pair(parentKey, parentPair));
                utils::insert_sorted(parentResolved, parentPair, byPathName);
            }
        }
    }

    // Stage 3: what found no drive but still names a valid one.
    for (PathDrive& candidate : unresolvedCandidates) {
        const wchar_t* name = candidate.getPathName();
        if (isValidPath(driveMap, fileSystems, mdAllDrives, name, false) &&
            fileSystemPathChecker(name, includedDrivePaths, excludedDrivePaths))
            unresolved.push_back(candidate);
    }

    // Stage 4.
    excluded.clear();
    if (log->istraceActive(4)) {
        log->traceMAX(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - list info...\n");
        traceResolverList(log, __func__, "resolved", resolved);
        traceResolverList(log, __func__, "parent resolved", parentResolved);
        traceResolverList(log, __func__, "excluded", excluded);
        traceResolverList(log, __func__, "unresolved", unresolved);
        log->traceMAX(__LINE__, __FILE__, __func__, "PathHelper::pathResolver - list info end\n");
    }
    return 1;
}

void PathHelper::pathDriveAccumulator(std::vector<PathDrive>& in, std::vector<PathDrive>& out,
                                      bool keepShortest) {
    for (const PathDrive& entry : in) out.push_back(entry);

    // Pass 1: nested paths on drives of one kind.
    for (size_t i = 0; i < out.size();) {
        bool erasedI = false;
        for (size_t j = i + 1; j < out.size();) {
            PathDrive& a = out[i];
            PathDrive& b = out[j];
            bool related = a.getDriveType() == b.getDriveType() &&
                           wcscmp(safe(a.getDriveFileSystem()), safe(b.getDriveFileSystem())) == 0 &&
                           !a.getExcludedDrive() && !b.getExcludedDrive();
            size_t lengthA = safeLength(a.getPathName());
            size_t lengthB = safeLength(b.getPathName());
            // Prefix over the shorter's length, with no check of the separator.
            if (related &&
                wcsncmp(safe(a.getPathName()), safe(b.getPathName()), std::min(lengthA, lengthB)) == 0) {
                bool eraseI = false;
                bool eraseJ = false;
                if (keepShortest) {
                    if (lengthB <= lengthA)
                        eraseI = true;
                    else
                        eraseJ = true;
                } else if (lengthA < lengthB) {
                    eraseJ = a.getRecursive();
                } else if (lengthB < lengthA) {
                    eraseI = b.getRecursive();
                } else if (b.getRecursive() && !a.getRecursive()) {
                    eraseI = true;
                } else {
                    eraseJ = true;
                }
                if (eraseI) {
                    out.erase(out.begin() + static_cast<std::ptrdiff_t>(i));
                    erasedI = true;
                    break;
                }
                if (eraseJ) {
                    out.erase(out.begin() + static_cast<std::ptrdiff_t>(j));
                    continue;
                }
            }
            ++j;
        }
        if (!erasedI) ++i;
    }

    // Pass 2: one path on two nested drives of one kind stays on the deeper mount.
    for (size_t i = 0; i < out.size();) {
        bool erasedI = false;
        for (size_t j = i + 1; j < out.size();) {
            PathDrive& a = out[i];
            PathDrive& b = out[j];
            if (a.getDriveType() == b.getDriveType() &&
                wcscmp(safe(a.getPathName()), safe(b.getPathName())) == 0) {
                if (safeLength(a.getDriveName()) <= safeLength(b.getDriveName())) {
                    out.erase(out.begin() + static_cast<std::ptrdiff_t>(i));
                    erasedI = true;
                    break;
                }
                out.erase(out.begin() + static_cast<std::ptrdiff_t>(j));
                continue;
            }
            ++j;
        }
        if (!erasedI) ++i;
    }
}

void PathHelper::pathReducer(PathInfo p, std::vector<PathInfo>& paths, std::vector<PathInfo>& names) {
    if (!p.getPathName()) return;
    const bool recursive = p.getRecursive();
    std::wstring name(p.getPathName());
    if (name.empty() || name[name.size() - 1] != L'/') {
        size_t slash = name.rfind(L'/');
        paths.push_back(PathInfo(name.c_str(), recursive));
        names.push_back(PathInfo(slash == std::wstring::npos ? name.c_str() : name.c_str() + slash + 1, recursive));
    }
    for (;;) {
        size_t slash = name.rfind(L'/');
        if (slash == std::wstring::npos) break;
        if (slash == 0 || name.rfind(L'/', slash - 1) == std::wstring::npos) {
            // No separator before it: what is left is the root.
            name.erase(slash + 1);
            paths.push_back(PathInfo(name.c_str(), recursive));
            names.push_back(PathInfo(name.c_str(), recursive));
            break;
        }
        name.erase(slash);
        size_t last = name.rfind(L'/');
        paths.push_back(PathInfo(name.c_str(), recursive));
        names.push_back(PathInfo(name.c_str() + last + 1, recursive));
    }
}

// --- exclude lists ------------------------------------------------------------

void PathHelper::reduceDriveList(std::vector<DriveInfo>& in, std::vector<DriveInfo>& out, PathDrive& root) {
    std::map<std::wstring, DriveInfo> byName;
    size_t turn = 0;
    for (const DriveInfo& drive : in) {
        if (++turn % CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_SMALL == 0) CpuThreshold::doIteration();
        if (!drive.getDriveName() || !drive.getDriveFileSystem()) continue;
        std::wstring name(drive.getDriveName());
        std::map<std::wstring, DriveInfo>::iterator existing = byName.find(name);
        if (existing == byName.end()) {
            byName.insert(std::make_pair(name, drive));
            continue;
        }
        bool replace;
        if (existing->second.getDriveType() == drive.getDriveType())
            replace = wcscmp(drive.getDriveFileSystem(), safe(root.getDriveFileSystem())) == 0;
        else
            replace = drive.getDriveType() == root.getDriveType();
        if (!replace) continue;
        log->traceMAX(__LINE__, __FILE__, __func__,
                      "PathHelper::reduceDriveList - element REMOVED: drive name: '%S', type: %d, fs: '%S'\n",
                      safe(existing->second.getDriveName()), static_cast<int>(existing->second.getDriveType()),
                      safe(existing->second.getDriveFileSystem()));
        // Erase and insert, so the new entry keeps its own excludedDrive flag.
        byName.erase(existing);
        byName.insert(std::make_pair(name, drive));
        log->traceMAX(__LINE__, __FILE__, __func__,
                      "PathHelper::reduceDriveList - element ADDED: drive name: '%S', type: %d, fs: '%S'\n",
                      drive.getDriveName(), static_cast<int>(drive.getDriveType()), drive.getDriveFileSystem());
    }
    for (const auto& entry : byName) out.push_back(entry.second);
}

void PathHelper::buildExcludeList(std::vector<DriveInfo>& drives, PathDrive& root, std::vector<PathInfo>& out) {
    const wchar_t* rootPath = safe(root.getPathName());
    log->traceMID(__LINE__, __FILE__, __func__,
                  "PathHelper::buildExcludeList - for path '%S' (drive: '%S', type: %d, fs: '%S')", rootPath,
                  safe(root.getDriveName()), static_cast<int>(root.getDriveType()), safe(root.getDriveFileSystem()));
    std::vector<DriveInfo> reduced;
    reduceDriveList(drives, reduced, root);
    std::set<std::wstring> added;
    size_t pathLength = wcslen(rootPath);
    if (pathLength > 0 && rootPath[pathLength - 1] == L'/') --pathLength;
    const bool rootIsRoot = wcscmp(rootPath, L"/") == 0;
    for (const DriveInfo& drive : reduced) {
        std::wstring name(safe(drive.getDriveName()));
        if (!name.empty() && name[name.size() - 1] != L'/') name.erase(name.size() - 1);
        if (!(pathLength < name.size())) continue;
        log->traceMAX(__LINE__, __FILE__, __func__,
                      "PathHelper::buildExcludeList - 'tmpPathLen(%d)<tmpDriveLen(%d)'\n", static_cast<int>(pathLength),
                      static_cast<int>(name.size()));
        if (wcsncmp(name.c_str(), rootPath, pathLength) != 0) continue;
        // The separator check keeps "/home2" from lying under "/home".
        if (!(name[pathLength] == L'/' || rootIsRoot)) continue;
        log->traceMAX(__LINE__, __FILE__, __func__, "PathHelper::buildExcludeList - '%S' is substring of '%S'\n",
                      rootPath, name.c_str());
        if (drive.getDriveType() == root.getDriveType() &&
            wcscmp(safe(drive.getDriveFileSystem()), safe(root.getDriveFileSystem())) == 0 &&
            !drive.getExcludedDrive() && !root.getExcludedDrive())
            continue;  // the same kind of storage stays in the walk
        if (added.find(name) != added.end()) continue;
        out.push_back(PathInfo(name.c_str(), true));
        added.insert(name);
        log->traceMID(__LINE__, __FILE__, __func__,
                      "PathHelper::buildExcludeList [1] - excluded path for '%S' is '%S'\n", rootPath, name.c_str());
    }
}

void PathHelper::fillExclude(PathDrive& root, std::vector<PathDrive>& excludes, std::vector<PathInfo>& out) {
    const wchar_t* rootPath = safe(root.getPathName());
    size_t rootLength = wcslen(rootPath);
    size_t turn = 0;
    for (const PathDrive& entry : excludes) {
        if (++turn % CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_SMALL == 0) CpuThreshold::doIteration();
        const wchar_t* path = entry.getPathName();
        if (!path) continue;
        size_t length = wcslen(path);
        const PathInfo& pathInfo = entry;
        if (length > rootLength && wcsncmp(path, rootPath, rootLength) == 0 &&
            entry.getDriveType() == root.getDriveType()) {
            out.push_back(pathInfo);
        } else if (length > 1 && path[0] == L'*') {
            // No fixed part: it applies below any root, once.
            if (!holds(out, pathInfo)) out.push_back(pathInfo);
        }
    }
}

void PathHelper::fileSystemPathDriveListPruning(std::vector<PathDrive>& list, std::vector<PathInfo>& included,
                                                std::vector<PathInfo>& excluded) {
    log->traceMID(__LINE__, __FILE__, __func__,
                  "PathHelper::fileSystemPathDriveListPruning - entering [list size is %d]...\n",
                  static_cast<int>(list.size()));
    for (size_t i = 0; i < list.size();) {
        if (!fileSystemPathChecker(list[i].getPathName(), included, excluded)) {
            log->traceMID(__LINE__, __FILE__, __func__,
                          "PathHelper::fileSystemPathDriveListPruning - path name '%S' removed!\n",
                          safe(list[i].getPathName()));
            list.erase(list.begin() + static_cast<std::ptrdiff_t>(i));
            continue;
        }
        ++i;
    }
    log->traceMID(__LINE__, __FILE__, __func__,
                  "PathHelper::fileSystemPathDriveListPruning - exit [list size is %d]\n",
                  static_cast<int>(list.size()));
}
