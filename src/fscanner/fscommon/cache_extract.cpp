// The last step of every cached query: the rows of the files table that pass
// the caller's expression are filtered by the directories the query asked for
// and written to the caller's writer.
//
// The two path buffers below are process-wide: one extraction at a time per
// process.

#include <cstdlib>
#include <cstring>
#include <cwchar>
#include <vector>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/cachetables.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/pathhelper.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/trace.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

const unsigned int EXTRACT_PATH_CHARS = 4096;
const size_t EXTRACT_NARROW_BYTES = 4096;
const unsigned int LINK_ATTRIBUTE = 0x1000;

// The directory being emitted, and the same text with a trailing separator.
wchar_t directoryPath[EXTRACT_PATH_CHARS];
wchar_t directoryWithSeparator[EXTRACT_PATH_CHARS];

// Narrow form of directory + name for the checksum pass; empty when the text
// does not fit or does not convert, so the file then counts as unreadable.
void narrowFilePath(wchar_t const* directory, wchar_t const* name, char* out, size_t outSize)
{
    out[0] = '\0';
    size_t dl = wcslen(directory);
    size_t nl = name != nullptr ? wcslen(name) : 0;
    if (dl + nl + 1 > EXTRACT_PATH_CHARS)
        return;
    wchar_t joined[EXTRACT_PATH_CHARS];
    wmemcpy(joined, directory, dl);
    if (nl != 0)
        wmemcpy(joined + dl, name, nl);
    joined[dl + nl] = L'\0';
    size_t n = wcstombs(out, joined, outSize - 1);
    if (n == static_cast<size_t>(-1) || n >= outSize - 1)
        out[0] = '\0';
    else
        out[n] = '\0';
}

// Owns the run's evaluator and commands, and releases them on every way out.
struct ExtractionState {
    CriteriaEvaluator* evaluator = nullptr;
    chPathCommand* pathCommand = nullptr;
    chTypeCommand* typeCommand = nullptr;
    std::vector<PathInfo> rootExcludes;
    RecordSet* filtered = nullptr;
    bool caseSensitive = false;
    ~ExtractionState()
    {
        // The cursor must not keep an evaluator that is about to go.
        if (filtered != nullptr)
            filtered->setCriteria(nullptr, caseSensitive);
        delete evaluator;
        delete pathCommand;
        delete typeCommand;
        // The shared command table still names "path" and "type", with the
        // commands just deleted.  Empty it: a name left there would also
        // change how the cache's own criteria read when one of them is first
        // parsed later ("pathid" lexes as the command path and the variable
        // id), and the rows of a removed tree would then stay behind.
        cmdTokenTable().clear();
    }
};

}  // namespace

int FS_CacheBase::extractResults(FsResultSetWriter& writer, wchar_t const* query,
                                 std::vector<DriveInfo>& drives, std::vector<PathDrive>& roots,
                                 std::vector<PathInfo>& includes, std::vector<PathInfo>& excludes,
                                 RecordSet& files, RecordSet& directories, bool caseSensitive,
                                 int timeoutMs)
{
    if (includes.empty()) {
        FS_TRACE(log, MID, "no included paths specified!");
        return SUCCESS;
    }

    ExtractionState state;
    state.evaluator = new CriteriaEvaluator(query != nullptr ? query : L"");
    state.pathCommand = new chPathCommand(this);
    state.typeCommand = new chTypeCommand();
    state.evaluator->addCmd(L"path", 1, 0, 1, state.pathCommand);
    state.evaluator->addCmd(L"type", 0, 1, 1, state.typeCommand);
    files.setCriteria(state.evaluator, caseSensitive);
    FsQueryStatistics& statistics = queryStatistics();
    if (files.get() != nullptr && files.get()->isIndexNavigation()) {
        statistics.lookup = FsQueryStatistics::LOOKUP_INDEX;
        ExpValue* hash = state.evaluator->getHashInfo();
        wchar_t const* column = hash != nullptr ? hash->getNValueString() : nullptr;
        statistics.indexColumn = column != nullptr ? column : L"";
    } else {
        statistics.lookup = FsQueryStatistics::LOOKUP_EVERY_ROW;
    }
    state.filtered = &files;
    state.caseSensitive = caseSensitive;

    // The columns by position, looked up once; a column the table lacks
    // reads as 0 or null, as it would by name.
    Fields* row = files.get() != nullptr ? files.get()->getRecord() : nullptr;
    auto position = [row](wchar_t const* name) -> unsigned int {
        int i = row != nullptr ? row->indexOf(name) : -1;
        return i >= 0 ? static_cast<unsigned int>(i) : 0xFFFFFFFFu;
    };
    const unsigned int colFileName = position(L"FILENAME");
    const unsigned int colAttr = position(L"ATTR");
    const unsigned int colSize = position(L"SIZE");
    const unsigned int colPathId = position(L"PATHID");
    const unsigned int colMd5 = position(L"MD5");
    const unsigned int colCrc32 = position(L"CRC32");
    const unsigned int colQ32 = position(L"Q32");

    PathHelper pathHelper(1);
    // The walk up to the last directory: the next one's mostly ends on it.
    PathChain lastWalk;
    unsigned int lastDirectoryId = 0;
    bool includeFile = false;
    int lastRootIndex = -1;
    unsigned int start = utils::getTickCount();

    for (bool more = files.moveFirst(); more; more = files.moveNext()) {
        // The budget is the caller's whole timeout, counted from the start of
        // the extraction, and is checked before every matching row.
        unsigned int passed = utils::getTickCount() - start;
        if (static_cast<long long>(timeoutMs) - static_cast<long long>(passed) <= 0) {
            FS_TRACE(log, MIN, "timed out!");
            return SCAN_TIMED_OUT;
        }

        unsigned int pathId = files.getFieldAsInt32(colPathId);
        if (pathId != lastDirectoryId) {
            // The throttle holds the query's share of the CPU here, once per
            // directory: a row costs nothing beyond the time check.
            CpuThreshold::doIteration();
            FS_TRACE_AS(log, MAX, "%s::%s bIncludeFile=false");
            if (!findPathByIdAlong(directories, pathId, directoryPath, EXTRACT_PATH_CHARS, &lastWalk)) {
                FS_TRACE(log, MIN, "findPathById() failed! extract interrupted!");
                return CACHE_UNUSABLE;
            }
            FS_TRACE_AS(log, MAX, "%s::%s for path: '%S'", directoryPath);
            lastDirectoryId = pathId;

            int index = checkPathDriveListEx(directoryPath, roots, mdLocalDriveGroup, caseSensitive);
            if (index != lastRootIndex) {
                state.rootExcludes.clear();
                if (index != -1) {
                    FS_TRACE_AS(log, MAX, "%s::%s building excludeList for pathIndex=%d for: '%S'",
                                index, directoryPath);
                    pathHelper.buildExcludeList(drives, roots[index], state.rootExcludes);
                }
            }

            bool included = true;
            if (!cacheRemoteDrives) {
                if (index == -1)
                    included = false;
                else if (!state.rootExcludes.empty() &&
                         checkPathList(directoryPath, state.rootExcludes, caseSensitive, false))
                    included = false;
            }
            if (included && !checkPathList(directoryPath, includes, caseSensitive, false))
                included = false;
            if (included && !excludes.empty() &&
                checkPathList(directoryPath, excludes, caseSensitive, false))
                included = false;

            if (included) {
                FS_TRACE_AS(log, MAX, "%s::%s PATH INCLUDED: '%S'", directoryPath);
                // directoryPath is shorter than EXTRACT_PATH_CHARS - 4: the
                // rebuild refuses anything longer.
                size_t len = wcslen(directoryPath);
                wmemcpy(directoryWithSeparator, directoryPath, len + 1);
                if ((len == 0 || directoryWithSeparator[len - 1] != PathHelper::PathSeparator) &&
                    len + 1 < EXTRACT_PATH_CHARS) {
                    directoryWithSeparator[len] = PathHelper::PathSeparator;
                    directoryWithSeparator[len + 1] = L'\0';
                }
                includeFile = true;
            } else {
                FS_TRACE_AS(log, MAX, "%s::%s PATH NOT included: '%S'", directoryPath);
                includeFile = false;
            }
            lastRootIndex = index;
        }
        if (!includeFile)
            continue;

        // Emission.
        if (knownHashes != nullptr && !knownHashes->empty()) {
            FileChecksumInfo info;
            info.flags = FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5;
            if (computeChecksums) {
                info.crc32 = files.getFieldAsInt32(colCrc32);
                info.q32 = files.getFieldAsInt32(colQ32);
                wchar_t const* md5 = files.getFieldAsString(colMd5);
                info.md5 = wchar_t2md5(md5 != nullptr ? md5 : L"0");
                info.valid = true;
            } else if ((files.getFieldAsInt32(colAttr) & LINK_ATTRIBUTE) == 0) {
                // A link is never opened: it keeps zero sums and find decides.
                // The row's ATTR has no bit for a pipe or a socket, so the
                // open itself refuses anything that is not a regular file by
                // then: such a file counts as unreadable.
                char narrow[EXTRACT_NARROW_BYTES];
                narrowFilePath(directoryWithSeparator, files.getFieldAsString(colFileName), narrow,
                               sizeof(narrow));
                if (narrow[0] != '\0' && computeRegularFileChecksumInfo(info, narrow) != 0) {
                    // A file that cannot be read counts as having zero sums.
                    info.crc32 = 0;
                    info.q32 = 0;
                    info.md5 = u_int128();
                }
            }
            if (!knownHashes->find(info))
                continue;
        }
        // The record carries the row as it stands: sums computed above only
        // for the filter do not reach it.
        writer.addRecord(directoryWithSeparator, files.getFieldAsString(colFileName),
                         files.getFieldAsInt64(colSize), files.getFieldAsInt32(colAttr),
                         files.getFieldAsString(colMd5), files.getFieldAsInt32(colCrc32),
                         files.getFieldAsInt32(colQ32));
        statistics.addHit();
    }
    return SUCCESS;
}
