#include "fscanner/fs/fs_resultset.h"

// ------------------------------------------------------------------- writer

FsFileInfo fileInfoOf(const wchar_t* path, const wchar_t* name, unsigned long long size,
                      unsigned int attr, const wchar_t* md5, unsigned int crc32, unsigned int q32) {
    FsFileInfo info;
    info.setFilePath(path);
    info.setFileName(name);
    info.setFileSize(size);
    info.setFileAttr(attr);
    info.setCRC32(crc32);
    info.setQ32(q32);
    info.setMD5(md5);
    return info;
}

FsResultSetWriter_OnVector::FsResultSetWriter_OnVector(std::vector<FsFileInfo>* storage)
    : records(storage) {}

FsResultSetWriter_OnVector::~FsResultSetWriter_OnVector() {}

int FsResultSetWriter_OnVector::addRecord(const wchar_t* path, const wchar_t* name,
                                          unsigned long long size, unsigned int attr,
                                          const wchar_t* md5, unsigned int crc32,
                                          unsigned int q32) {
    if (records == nullptr) return -1;
    FsFileInfo info = fileInfoOf(path, name, size, attr, md5, crc32, q32);
    records->push_back(info);
    return 0;
}

int FsResultSetWriter_OnVector::addRecord(const FsFileInfo& info) {
    if (records == nullptr) return -1;
    records->push_back(info);
    return 0;
}

int FsResultSetWriter_OnVector::close() { return 0; }

// ------------------------------------------------------------------- reader

FsResultSetReader_OnVector::FsResultSetReader_OnVector(std::vector<FsFileInfo>* storage)
    : records(storage), index(0) {}

FsResultSetReader_OnVector::~FsResultSetReader_OnVector() { delete records; }

void FsResultSetReader_OnVector::moveFirst() {
    if (records != nullptr) index = 0;
}

int FsResultSetReader_OnVector::getNext(FsFileInfo& info) {
    if (records == nullptr || index >= records->size()) return 0;
    info = (*records)[index];
    ++index;
    return 1;
}

int FsResultSetReader_OnVector::sort(unsigned int, unsigned int, bool) { return 0; }

int FsResultSetReader_OnVector::setBookmark() { return 0; }

int FsResultSetReader_OnVector::toBookmark() { return 0; }

// ---------------------------------------------------------------------- set

FsResultSet_OnVector::FsResultSet_OnVector()
    : records(new std::vector<FsFileInfo>()), reader(nullptr), writer(nullptr) {}

// Deletes the writer only: the vector and its records belong to the reader,
// which the caller deletes, possibly after this set.
FsResultSet_OnVector::~FsResultSet_OnVector() { delete writer; }

FsResultSetReader* FsResultSet_OnVector::getReader() {
    if (reader == nullptr) {
        if (writer != nullptr) writer->close();
        reader = new FsResultSetReader_OnVector(records);
    }
    return reader;
}

FsResultSetWriter* FsResultSet_OnVector::getWriter() {
    if (writer == nullptr) writer = new FsResultSetWriter_OnVector(records);
    return writer;
}
