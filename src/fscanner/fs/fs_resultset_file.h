// Result set on a temporary file: records may exceed memory, and the file
// can be sorted in place.
//
// Records are written through FsSerializator_OnFile (see fs_serializer.h for
// the encoding) on a LinuxMmFile.  Ownership is that of every result set: the
// set owns its writer; whoever called getReader owns the reader, and may
// delete it after the set.  The file goes with whichever of the two ends last
// in charge of it: the set unlinks it when no reader was ever made, otherwise
// the reader unlinks it at its end.
//
// A crash while writing leaves the file at a multiple of 16 MiB, zeros behind
// the records, and nobody removes it.
//
// Result sets are for one thread at a time; they have no locks.
#ifndef FSCANNER_FS_FS_RESULTSET_FILE_H
#define FSCANNER_FS_FS_RESULTSET_FILE_H

#include <cstdint>

#include "fscanner/fs/fs_resultset.h"

class AbstractFile;
class FsSerializator;

// Clean-up handler for a process that ends while its result sets live: with
// a code other than 0 it unlinks the file named by name (an 8-bit name) and
// the scratch files of a sort that may be running on it (the name followed
// by ".a" and ".b"), then traces.  Only unlink runs before the trace, so the
// files are gone even when the handler is called from a signal handler that
// interrupted a trace.  Code 0 does nothing.
void deleteFile_CleanupHandler(int code, void* name);

// Writer: appends records to the file.  The file is created by the
// constructor; its creation is not checked, and a writer on a file that could
// not be made answers every addRecord with the serialiser's error.
class FsResultSetWriter_OnFile : public FsResultSetWriter {
public:
    explicit FsResultSetWriter_OnFile(char const* name);
    // Deletes serialiser and file object.  The file stays on disk.
    ~FsResultSetWriter_OnFile() override;

    // -1 after close(); otherwise the serialiser's error (0 when written).
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                  unsigned int attr, const wchar_t* md5, unsigned int crc32,
                  unsigned int q32) override;
    int addRecord(const FsFileInfo& info) override;
    // Closes the file, which cuts it to its content.  Returns 0; every later
    // addRecord answers -1.
    int close() override;

private:
    FsResultSetWriter_OnFile(const FsResultSetWriter_OnFile&);
    FsResultSetWriter_OnFile& operator=(const FsResultSetWriter_OnFile&);

    FsSerializator* serializator;
    AbstractFile* file;
};

// Reader: opens the file at moveFirst(), which must come before the first
// getNext.  Owns its own copy of the name and unlinks the file at its end.
class FsResultSetReader_OnFile : public FsResultSetReader {
public:
    // A null name is a fatal error (the process aborts with "filename != 0").
    explicit FsResultSetReader_OnFile(char const* filename);
    ~FsResultSetReader_OnFile() override;

    // (Re)opens the file at its first record; any error is forgotten.
    void moveFirst() override;
    // 1 and the record in info; 0 at the end of the file, after damage, and
    // before moveFirst.  The end shows as a read error, which stays stored
    // until toBookmark or moveFirst.
    int getNext(FsFileInfo& info) override;
    // Sorts the file by key 1 path, 2 name, 3 full path, 4 size, order 1
    // ascending or 2 descending; flag is the case flag of the comparison.
    // 0 for another key, with the reader untouched.  Otherwise the reader is
    // closed, the sort runs, and the result is 1 whatever the sort gave (an
    // order other than 1 or 2 leaves the file as it was).  moveFirst() comes
    // next.  The order is that of NaturalMergeSort's passes, ties included.
    // A file of up to 48 MiB is read once, ordered in memory and written
    // once (under the first scratch name, then renamed over the file: a
    // failure leaves it as it was); a larger one goes through the passes on
    // disk, in constant memory.
    int sort(unsigned int key, unsigned int order, bool flag) override;
    // Remembers the position of the next record; 0 when the file is not open.
    int setBookmark() override;
    // Goes back to the remembered position and forgets any error; 0 when the
    // file is not open.
    int toBookmark() override;

private:
    FsResultSetReader_OnFile(const FsResultSetReader_OnFile&);
    FsResultSetReader_OnFile& operator=(const FsResultSetReader_OnFile&);

    char* fileName;
    uint32_t bookmark;
    FsSerializator* serializator;
    AbstractFile* file;
};

// The set.  The constructor picks a temporary name (tmpnam, else "./fsq_<n>",
// else "/tmp/fsq_<n>" for n from 0 to 19999) and ends the process with exit
// code 41 when it finds none.  It registers deleteFile_CleanupHandler for the
// name with FsResourceManager.
class FsResultSet_OnFile : public FsResultSet {
public:
    FsResultSet_OnFile();
    // Deletes the writer, unlinks the file if no reader was ever made, drops
    // the clean-up registration and frees the name.
    ~FsResultSet_OnFile() override;

    // The caller owns it.  The first call closes the writer, if any.
    FsResultSetReader* getReader() override;
    // The set owns it.
    FsResultSetWriter* getWriter() override;

    // The temporary file name in use (8-bit); owned by the set.
    const char* getFileName() const { return fileName; }

    // Where temporary names come from.  generator stands for tmpnam (it is
    // called with null and its result copied); the two prefixes stand for
    // "./" and "/tmp/" of the fallback, each followed by "fsq_<n>".  For
    // tests; the defaults serve every real use.  Not thread-safe.
    typedef char* (*TempNameGenerator)(char*);
    static void setTempNameSources(TempNameGenerator generator, const char* firstPrefix,
                                   const char* secondPrefix);
    static void resetTempNameSources();

private:
    FsResultSet_OnFile(const FsResultSet_OnFile&);
    FsResultSet_OnFile& operator=(const FsResultSet_OnFile&);

    char* fileName;
    FsResultSetReader_OnFile* reader;
    FsResultSetWriter_OnFile* writer;
};

#endif
