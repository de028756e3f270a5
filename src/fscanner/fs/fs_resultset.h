// Where the hits of a query go.  The scan and the cache only see an
// FsResultSetWriter; the caller picks the concrete set and reads it back
// through its FsResultSetReader.
//
// Ownership, the same for every kind of set: the set owns its writer; the
// caller of getReader owns the reader and may delete it after the set; the
// reader owns the stored records.
//
// The virtual operations are an ABI: keep their order.
#ifndef FSCANNER_FS_FS_RESULTSET_H
#define FSCANNER_FS_FS_RESULTSET_H

#include <vector>

#include "fscanner/fs/fs_fileinfo.h"

class FsResultSetReader;
class FsResultSetWriter;

// A record of the seven fields that the writers' addRecord takes, each set
// as its setter on FsFileInfo sets it.
FsFileInfo fileInfoOf(const wchar_t* path, const wchar_t* name, unsigned long long size,
                      unsigned int attr, const wchar_t* md5, unsigned int crc32, unsigned int q32);

class FsResultSet {
public:
    virtual ~FsResultSet() {}
    // The caller owns the result and deletes it.  The first call closes the
    // writer if one exists; later calls return the same reader.
    virtual FsResultSetReader* getReader() = 0;
    // The set owns the result.  Later calls return the same writer.
    virtual FsResultSetWriter* getWriter() = 0;
};

class FsResultSetReader {
public:
    virtual ~FsResultSetReader() {}
    virtual void moveFirst() = 0;
    // 1 when a record was copied into info, 0 when none is left or there is
    // no storage (info is then untouched).
    virtual int getNext(FsFileInfo& info) = 0;
    // key: 1 path, 2 name, 3 path and name, 4 size; order: 1 ascending,
    // 2 descending; flag: case flag for FsFileInfo::compare.  1 when sorted.
    virtual int sort(unsigned int key, unsigned int order, bool flag) = 0;
    // 1 when done, 0 when not.
    virtual int setBookmark() = 0;
    virtual int toBookmark() = 0;
};

class FsResultSetWriter {
public:
    virtual ~FsResultSetWriter() {}
    // 0 on success, -1 without a backing store, other values are errors of
    // the store.
    virtual int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                          unsigned int attr, const wchar_t* md5, unsigned int crc32,
                          unsigned int q32) = 0;
    virtual int addRecord(const FsFileInfo& info) = 0;
    // 0.  The in-memory writer stays usable afterwards.
    virtual int close() = 0;
};

// In-memory writer: appends copies to a vector it does not own.
class FsResultSetWriter_OnVector : public FsResultSetWriter {
public:
    explicit FsResultSetWriter_OnVector(std::vector<FsFileInfo>* records);
    ~FsResultSetWriter_OnVector() override;
    // Builds a record with setFilePath, setFileName, setFileSize, setFileAttr,
    // setCRC32, setQ32, setMD5: the bits of attr, size, CRC32 and Q32 are set.
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                  unsigned int attr, const wchar_t* md5, unsigned int crc32,
                  unsigned int q32) override;
    int addRecord(const FsFileInfo& info) override;
    // Does nothing; returns 0.
    int close() override;

private:
    std::vector<FsFileInfo>* records;
};

// In-memory reader: owns the vector and every record in it.
class FsResultSetReader_OnVector : public FsResultSetReader {
public:
    explicit FsResultSetReader_OnVector(std::vector<FsFileInfo>* records);
    // Destroys the records and deletes the vector.
    ~FsResultSetReader_OnVector() override;
    void moveFirst() override;
    // Takes the vector's size at every call, so records appended after the
    // reader was made are seen.
    int getNext(FsFileInfo& info) override;
    // An in-memory set can be neither sorted nor bookmarked: all return 0.
    int sort(unsigned int key, unsigned int order, bool flag) override;
    int setBookmark() override;
    int toBookmark() override;

private:
    std::vector<FsFileInfo>* records;
    unsigned int index;
};

// In-memory set.  Its destructor deletes the writer only: the vector belongs
// to the reader, so a set whose reader was never requested leaves its vector
// behind (kept so; the file-backed set deletes its file in that case).
class FsResultSet_OnVector : public FsResultSet {
public:
    FsResultSet_OnVector();
    ~FsResultSet_OnVector() override;
    FsResultSetReader* getReader() override;
    FsResultSetWriter* getWriter() override;

private:
    FsResultSet_OnVector(const FsResultSet_OnVector&);
    FsResultSet_OnVector& operator=(const FsResultSet_OnVector&);

    std::vector<FsFileInfo>* records;
    FsResultSetReader_OnVector* reader;
    FsResultSetWriter_OnVector* writer;
};

#endif
