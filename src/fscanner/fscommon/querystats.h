// What one query did, as values a host can read: how each root was answered,
// how much of the disk was read, how many hits went out, and which entries the
// walks left out of the answer and why.
//
// A cache object keeps one record for its last query
// (FS_CacheBase::lastQueryStatistics); the direct walk fills one that its
// caller hands to fs_build.  Traces say the same things for a person reading a
// log; a program reads this record instead.
//
// Threads: the record is written by the thread that runs the query.  Only
// entriesScanned() may be read by another thread while the query runs (a
// progress display); everything else is read after the query returned.
#ifndef FSCANNER_FSCOMMON_QUERYSTATS_H
#define FSCANNER_FSCOMMON_QUERYSTATS_H

#include <atomic>
#include <cstddef>
#include <string>
#include <vector>

class FsQueryStatistics {
public:
    // Why a walk left an entry out.  Whatever lies below a skipped directory
    // is not read either and is not counted on its own.
    enum SkipCause {
        // A directory that could not be opened or read (permission denied,
        // an I/O error, a directory removed during the walk).  Its error is
        // kept with its path.  A directory whose reading broke off part way
        // is counted here too; the entries read before the error are
        // answered as usual.
        SKIP_UNREADABLE_DIRECTORY = 0,
        // A name that does not convert to a wide string in the current
        // locale (LC_CTYPE): the entry is left out, and a directory so named
        // with everything below it.
        SKIP_UNDECODABLE_NAME = 1,
        // A path longer than the engine's limit of 4095 characters, or than
        // the system's of 4095 bytes.  The direct walk leaves out every entry
        // whose path passes 4095 characters.  An entry past the system's
        // limit has no status: the walks keep it as a file with attributes 0
        // and size 0 (the direct walk offers it, the cache scan stores it)
        // and read nothing below it.
        SKIP_PATH_TOO_LONG = 2,
        // An entry whose status cannot be read for another reason (a
        // directory that may be listed but not searched, an entry removed
        // during the walk).  Kept as a file with attributes 0 and size 0, as
        // above, and nothing below it is read.  Its error is kept.
        SKIP_NO_STATUS = 3
    };
    static const int SKIP_CAUSES = 4;
    // How many skipped paths are kept for each cause; the count goes on.
    static const size_t KEPT_PATHS = 5;

    // How the cache's files table was read for the hits.
    enum Lookup {
        LOOKUP_NONE = 0,       // not read (no local root, or a direct walk)
        LOOKUP_INDEX = 1,      // through the hash index on indexColumn
        LOOKUP_EVERY_ROW = 2   // every row was read and tested
    };

    struct SkippedEntries {
        long long count;
        // The first KEPT_PATHS paths, in the order met, as the bytes the
        // system gave (a name that is not valid in the locale is kept as it
        // is on disk).
        std::vector<std::string> paths;
        // errno of each kept path (0 where the cause has none).
        std::vector<int> errors;
        SkippedEntries() : count(0) {}
    };

    // Roots of the query answered from the cache's tables, scanned again into
    // them, and walked directly (remote roots, or every root of a direct walk).
    int rootsFromCache;
    int rootsRebuilt;
    int rootsWalked;
    // Files met in directories the query includes (every file, cached or
    // not) and directories entered below the roots, by this query's walks.
    long long filesScanned;
    long long directoriesScanned;
    // Records handed to the caller's writer.
    long long hits;
    Lookup lookup;
    std::wstring indexColumn;  // with LOOKUP_INDEX; empty otherwise
    SkippedEntries skipped[SKIP_CAUSES];

    FsQueryStatistics();
    FsQueryStatistics(const FsQueryStatistics& other);
    FsQueryStatistics& operator=(const FsQueryStatistics& other);

    // Back to a record of nothing done.  Safe while another thread reads
    // entriesScanned().
    void reset();
    // Entries skipped for every cause together.
    long long skippedTotal() const;
    // Files and directories read so far by the query under way; may be read
    // from any thread at any time.
    long long entriesScanned() const { return progress.load(std::memory_order_relaxed); }

    // --- recording, by the walks ---
    void addFile()
    {
        ++filesScanned;
        progress.fetch_add(1, std::memory_order_relaxed);
    }
    void addDirectory()
    {
        ++directoriesScanned;
        progress.fetch_add(1, std::memory_order_relaxed);
    }
    void addHit() { ++hits; }
    // Counts one skipped entry; its path is directory, a separator unless
    // directory ends in one, and name (either may be null or empty).
    void addSkipped(SkipCause cause, const char* directory, const char* name, int error);
    // The same for a path the engine holds as a wide string: it is kept in
    // the locale's form, or as UTF-8 when it has none.
    void addSkipped(SkipCause cause, const wchar_t* path, int error);

private:
    std::atomic<long long> progress;
};

#endif
