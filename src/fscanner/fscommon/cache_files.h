// The files of a cache directory: every name the library gives them, and the
// reading and writing of the small side files beside the tables.
//
// A cache directory holds, for a directories table D and a files table F:
//
//   <T>.dat, <T>.pxx, <T>_idx.dat   table T's data, pointer and index list
//                                   files (layout in table_format.h)
//   <I>.idx                         hash index I of a table
//   <T>_cpt.*, <I>_cpt.idx          a compaction's copy, renamed over T's
//                                   files when it completes
//   <D>.counter                     the directory id counter (below)
//   <D>.cuflag                      update flag: empty, present from the
//                                   cache's create to its close, so that a
//                                   process that died with the cache open
//                                   leaves it behind
//   cat_set, ex_hash, pr_hash       the caching set and the two validity
//                                   marks (below)
//
// Beside them, outside the directory: the table lock files <T>_t_mutex, in
// the lock store directory, the cache's access lock named from the cache
// path and "_c_mutex", and the scanned-folder log in the trace directory.
//
// Side file layouts, host byte order throughout:
//
// <D>.counter: exactly 4 bytes, the last directory id given (uint32_t).
//
// ex_hash: records back to back, no header, no count.  One record:
//   offset 0          4 bytes        length of the key in bytes
//   offset 4          length bytes   root path, multibyte, no terminator,
//                                    without one trailing "/" or "\"; the
//                                    root "/" has an empty key
//   offset 4+length   16 bytes       raw MD5 over the root's exclude list
//                                    (16 zero bytes for an empty list)
// A key longer than EXCLUDE_KEY_LIMIT bytes is damage.  The file is
// rewritten whole each time.
//
// pr_hash: exactly 16 bytes, the raw MD5 of the provider name.
//
// cat_set: records back to back, no header, no count.  One record: a
// uint32_t count of wide characters, then that many 4-byte wide characters,
// no terminator.  A count above CATALOG_RECORD_LIMIT is damage.
//
// All side files are written in place, without a temporary name: the
// caller's access lock is their only protection.  Reading and writing go
// through the process's Env; nothing here traces.
#ifndef FSCANNER_FSCOMMON_CACHE_FILES_H
#define FSCANNER_FSCOMMON_CACHE_FILES_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace cachefiles {

// ---------------------------------------------------------------- names
const wchar_t TABLE_DATA_SUFFIX[] = L".dat";
const wchar_t TABLE_POINTER_SUFFIX[] = L".pxx";
const wchar_t TABLE_INDEX_LIST_SUFFIX[] = L"_idx.dat";
const wchar_t TABLE_LOCK_SUFFIX[] = L"_t_mutex";
const wchar_t INDEX_SUFFIX[] = L".idx";
const wchar_t COMPACTION_SUFFIX[] = L"_cpt";
const wchar_t COUNTER_SUFFIX[] = L".counter";
const wchar_t UPDATE_FLAG_SUFFIX[] = L".cuflag";
const wchar_t CATALOG_SET_NAME[] = L"cat_set";
const wchar_t EXCLUDE_DIGESTS_NAME[] = L"ex_hash";
const wchar_t PROVIDER_DIGEST_NAME[] = L"pr_hash";
const wchar_t ACCESS_MUTEX_SUFFIX[] = L"_c_mutex";
const char FOLDER_LOG_NAME[] = "traceKEL_scanned_dirs.log";

// a + b + c in a new kelm_malloc block; null when any part is null or
// memory is short.  The table's names are made with it.
wchar_t* joinName(wchar_t const* a, wchar_t const* b, wchar_t const* c = L"");

// "<table>.dat", "<table>_idx.dat", "<table>_t_mutex", "<index>.idx",
// "<name>_cpt": kelm_malloc, null on a null argument.
wchar_t* tableDataName(wchar_t const* table);
wchar_t* tableIndexListName(wchar_t const* table);
wchar_t* tableLockName(wchar_t const* table);
wchar_t* indexFileName(wchar_t const* index);
wchar_t* compactionName(wchar_t const* name);
// "<directory><table>.pxx"; directory ends in its separator.  kelm_malloc.
wchar_t* tablePointerPath(wchar_t const* directory, wchar_t const* table);

// directory, "/" unless it ends in one, name, suffix: a new new[] string;
// null when an argument is null or memory is short.
wchar_t* cacheFileName(wchar_t const* directory, wchar_t const* name, wchar_t const* suffix);
// The side files of the cache in cacheDirectory (new[] strings, as
// cacheFileName): "<D>.counter", "<D>.cuflag", "cat_set", "ex_hash".
wchar_t* counterPath(wchar_t const* cacheDirectory, wchar_t const* directoriesTable);
wchar_t* updateFlagPath(wchar_t const* cacheDirectory, wchar_t const* directoriesTable);
wchar_t* catalogSetPath(wchar_t const* cacheDirectory);
wchar_t* excludeDigestsPath(wchar_t const* cacheDirectory);
// cacheDirectory + "/pr_hash", the separator always added (kelm_malloc).
wchar_t* providerDigestPath(wchar_t const* cacheDirectory);
// cacheDirectory + "_c_mutex" with every "/" and ":" made "_", so that the
// name can itself be a file name (kelm_malloc).
wchar_t* accessMutexName(wchar_t const* cacheDirectory);
// "<traceDirectory>/traceKEL_scanned_dirs.log"; a null directory counts as
// empty, which gives "/traceKEL_scanned_dirs.log".
std::string folderLogPath(char const* traceDirectory);

// ----------------------------------------------------------- side files
// The functions below take the multibyte path.  A false result leaves
// errno at the system's reason unless said otherwise.

const size_t COUNTER_SIZE = 4;
const size_t DIGEST_SIZE = 16;
const size_t EXCLUDE_LENGTH_SIZE = 4;
const uint32_t EXCLUDE_KEY_LIMIT = 4095;
const size_t CATALOG_COUNT_SIZE = 4;
// A record is read into a 16 KiB zeroed buffer with its terminator.
const uint32_t CATALOG_RECORD_LIMIT = 0x4000 / sizeof(wchar_t) - 1;

// .counter: false for a missing file or one shorter than 4 bytes (only its
// first 4 bytes are read).
bool readCounter(char const* path, uint32_t* value);
// Overwrites an existing counter in place (its four bytes have their block
// already, so a full disk cannot cut it short and make the next open refuse
// the cache) and makes a missing one; a longer file is cut to 4 bytes.
bool writeCounter(char const* path, uint32_t value);

// .cuflag: made anew, empty (mode 0660).  Present when it can be opened
// for reading and writing: a flag that cannot be made or opened counts as
// absent, so an unwritable directory does not block a cache by itself.
bool createUpdateFlag(char const* path);
bool updateFlagPresent(char const* path);

// Unlinks a side file; false when it was not there to remove.
bool removeSideFile(char const* path);

// pr_hash: the first 16 bytes.  False for a missing or shorter file.
// exact, when given, tells whether the file holds those 16 bytes and no
// more, as the writer leaves it.
bool readProviderDigest(char const* path, unsigned char (&digest)[DIGEST_SIZE], bool* exact);
bool writeProviderDigest(char const* path, unsigned char const (&digest)[DIGEST_SIZE]);

// ex_hash.
struct ExcludeDigest {
    std::string key;
    unsigned char digest[DIGEST_SIZE];
};
// What ended the reading of a file of records.
enum ReadEnd {
    END_OF_FILE,    // every record whole (or no file: the result is false)
    CUT_SHORT,      // the last record is incomplete; those before it stand
    DAMAGED_RECORD  // a record's length is out of range; reading stopped there
};
// Appends the complete records, in file order, to *records.  False when
// the file cannot be read at all.  *end says why reading stopped;
// *damagedLength is the length word of a damaged record.
bool readExcludeDigests(char const* path, std::vector<ExcludeDigest>* records, ReadEnd* end,
                        uint32_t* damagedLength);
// Replaces the file with the records, in order.  False when it cannot be
// made or a write fails (the file then holds whole records up to the cut,
// at best); *opened tells the two apart.
bool writeExcludeDigests(char const* path, std::vector<ExcludeDigest> const& records, bool* opened);

// cat_set.
// Appends the complete records to *records; as readExcludeDigests, with
// *damagedCount the character count of a damaged record.
bool readCatalogSet(char const* path, std::vector<std::wstring>* records, ReadEnd* end,
                    uint32_t* damagedCount);
// Replaces the file with the records, in order.  False when it cannot be
// made or a write fails; *opened tells the two apart, and a file that was
// made is left as far as it got, for the caller to remove.
bool writeCatalogSet(char const* path, std::vector<std::wstring> const& records, bool* opened);

}  // namespace cachefiles

#endif
