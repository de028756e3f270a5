#include "fscanner/fs/fs_resultset_file.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <new>

#include "base/QvLogWrapper.h"
#include "base/kelmem.h"
#include "fscanner/fs/fs_loader.h"
#include "fscanner/fs/fs_resultset_sort.h"
#include "fscanner/fs/fs_serializer.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/naturalmerge.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/sysfile.h"
#include "fscanner/fscommon/utils.h"

namespace {

// Exit code of a process that cannot find any temporary name.
const int kExitNoTempName = 41;
// Numbers tried under each fallback prefix: fsq_0 .. fsq_19999.
const int kFallbackNames = 20000;

char* defaultTempName(char* buffer) {
    return fscanner::Env::Current()->tempName(buffer);
}

FsResultSet_OnFile::TempNameGenerator g_tempNameGenerator = defaultTempName;
const char* g_firstPrefix = "./";
const char* g_secondPrefix = "/tmp/";

// Makes a new empty file prefix + "fsq_<n>" for the first n whose file does
// not exist yet and can be created.  The creation is exclusive, so two
// processes that try one name at once cannot both take it.  Null when none
// can be made.
char* fallbackTempName(const char* prefix) {
    if (prefix == nullptr) return nullptr;
    fscanner::Env* env = fscanner::Env::Current();
    char candidate[4096];
    for (int n = 0; n < kFallbackNames; ++n) {
        int written = std::snprintf(candidate, sizeof(candidate), "%sfsq_%d", prefix, n);
        if (written < 0 || static_cast<size_t>(written) >= sizeof(candidate)) return nullptr;
        int fd = env->openFile(candidate, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0666);
        if (fd == -1) continue;  // taken, or this directory refuses it
        env->closeFile(fd);
        return i_strdup(candidate);
    }
    return nullptr;
}

// A LinuxMmFile on the 8-bit name, widened on the way as the factory wants.
AbstractFile* makeFile(const char* name) {
    wchar_t* wide = utils::myMbsToWcsString(name);
    AbstractFile* file = SysFactory::createMmFile(wide);
    delete[] wide;
    return file;
}

}  // namespace

void deleteFile_CleanupHandler(int code, void* name) {
    if (code == 0) return;
    // The handler serves processes that end, often from a signal handler:
    // the files go first, with nothing but unlink, and the trace after them.
    // With the file go the scratch files of a sort that may be running on it.
    if (name != nullptr) {
        const char* file = static_cast<const char*>(name);
        fscanner::Env* env = fscanner::Env::Current();
        env->removeFile(file);
        char scratch[4096 + 8];
        size_t length = std::strlen(file);
        for (const char* suffix : {NATURAL_MERGE_SCRATCH_A, NATURAL_MERGE_SCRATCH_B}) {
            size_t suffixLength = std::strlen(suffix);
            if (length + suffixLength >= sizeof scratch) break;
            std::memcpy(scratch, file, length);
            std::memcpy(scratch + length, suffix, suffixLength + 1);
            env->removeFile(scratch);
        }
    }
    getQvLogFs()->traceMID(__LINE__, __FILE__, __func__,
                           "Cleanup handler invoked (code: %d), deleting temp file: %s\n", code,
                           static_cast<const char*>(name));
}

// ---- writer -----------------------------------------------------------------

FsResultSetWriter_OnFile::FsResultSetWriter_OnFile(char const* name)
    : serializator(nullptr), file(nullptr) {
    file = makeFile(name);
    if (file != nullptr) file->create();
    serializator = new FsSerializator_OnFile(file, true);
}

FsResultSetWriter_OnFile::~FsResultSetWriter_OnFile() {
    delete serializator;
    delete file;
}

int FsResultSetWriter_OnFile::addRecord(const FsFileInfo& info) {
    if (serializator == nullptr) return -1;
    return info.saveObject(*serializator);
}

int FsResultSetWriter_OnFile::addRecord(const wchar_t* path, const wchar_t* name,
                                        unsigned long long size, unsigned int attr,
                                        const wchar_t* md5, unsigned int crc32,
                                        unsigned int q32) {
    if (serializator == nullptr) return -1;
    FsFileInfo info = fileInfoOf(path, name, size, attr, md5, crc32, q32);
    return info.saveObject(*serializator);
}

int FsResultSetWriter_OnFile::close() {
    // The serialiser closes the file, which cuts it to its logical size.
    delete serializator;
    serializator = nullptr;
    return 0;
}

// ---- reader -----------------------------------------------------------------

FsResultSetReader_OnFile::FsResultSetReader_OnFile(char const* filename)
    : fileName(nullptr), bookmark(0), serializator(nullptr), file(nullptr) {
    if (filename == nullptr) {
        getQvLogFs()->traceMIN(__LINE__, __FILE__, __func__,
                               "FsResultSetReader_OnFile - assertion failed: filename != 0\n");
        std::fprintf(stderr, "%s:%d: assertion failed: filename != 0\n", __FILE__, __LINE__);
        std::abort();
    }
    fileName = i_strdup(filename);
}

FsResultSetReader_OnFile::~FsResultSetReader_OnFile() {
    delete serializator;
    delete file;
    if (fileName != nullptr) fscanner::Env::Current()->removeFile(fileName);
    kelm_free(fileName);
}

void FsResultSetReader_OnFile::moveFirst() {
    delete serializator;
    serializator = nullptr;
    delete file;
    file = makeFile(fileName);
    if (file != nullptr) file->open();
    serializator = new FsSerializator_OnFile(file, true);
}

int FsResultSetReader_OnFile::getNext(FsFileInfo& info) {
    if (file == nullptr || serializator == nullptr) return 0;
    return info.loadObject(*serializator) == 0 ? 1 : 0;
}

int FsResultSetReader_OnFile::setBookmark() {
    if (file == nullptr) return 0;
    bookmark = static_cast<uint32_t>(file->tell());
    return 1;
}

int FsResultSetReader_OnFile::toBookmark() {
    if (file == nullptr || serializator == nullptr) return 0;
    serializator->reset();
    file->seek(static_cast<long>(bookmark), SEEK_FROM_START);
    return 1;
}

int FsResultSetReader_OnFile::sort(unsigned int key, unsigned int order, bool flag) {
    QvLogWrapper* trace = getQvLogFs();
    trace->traceMID(__LINE__, __FILE__, __func__,
                    "FsResultSetReader_OnFile::sort - entering...\n");
    resultsort::PassCallbacks callbacks;
    if (!resultsort::passCallbacks(key, callbacks)) {
        trace->traceMID(__LINE__, __FILE__, __func__,
                        "FsResultSetReader_OnFile::sort - exiting...\n");
        return 0;
    }

    // The reader stands closed from here on; moveFirst() reopens it.
    delete serializator;
    serializator = nullptr;
    delete file;
    file = nullptr;

    wchar_t* wideName = utils::myMbsToWcsString(fileName);
    trace->traceMID(__LINE__, __FILE__, __func__,
                    "FsResultSetReader_OnFile::sort - file name is %S\n", wideName);
    NaturalMergeSort* sorter =
        new NaturalMergeSort(callbacks.compare, callbacks.read, callbacks.write, callbacks.peek,
                             callbacks.free);
    trace->traceMID(__LINE__, __FILE__, __func__,
                    "FsResultSetReader_OnFile::sort - naturalMergeSort object created!\n");
    if (!resultsort::sortInMemory(fileName, wideName, key, order, flag)) sorter->sort(wideName, order, flag);
    trace->traceMID(__LINE__, __FILE__, __func__,
                    "FsResultSetReader_OnFile::sort - file sorted!\n");
    delete sorter;
    delete[] wideName;
    trace->traceMID(__LINE__, __FILE__, __func__,
                    "FsResultSetReader_OnFile::sort - exiting...\n");
    return 1;
}

// ---- set --------------------------------------------------------------------

void FsResultSet_OnFile::setTempNameSources(TempNameGenerator generator, const char* firstPrefix,
                                            const char* secondPrefix) {
    g_tempNameGenerator = generator;
    g_firstPrefix = firstPrefix;
    g_secondPrefix = secondPrefix;
}

void FsResultSet_OnFile::resetTempNameSources() {
    setTempNameSources(defaultTempName, "./", "/tmp/");
}

FsResultSet_OnFile::FsResultSet_OnFile() : fileName(nullptr), reader(nullptr), writer(nullptr) {
    QvLogWrapper* trace = getQvLogFs();
    // tmpnam only proposes a name; nothing is created until the writer.
    const char* proposed = g_tempNameGenerator != nullptr ? g_tempNameGenerator(nullptr) : nullptr;
    if (proposed != nullptr) fileName = i_strdup(proposed);
    if (fileName == nullptr) fileName = fallbackTempName(g_firstPrefix);
    if (fileName == nullptr) fileName = fallbackTempName(g_secondPrefix);
    trace->traceMID(__LINE__, __FILE__, __func__, "The temp file name is: %s\n", fileName);
    if (fileName == nullptr) {
        trace->traceMIN(__LINE__, __FILE__, __func__, "Exiting due to null temp file name: %s\n",
                        std::strerror(errno));
        std::exit(kExitNoTempName);
    }
    trace->traceMID(__LINE__, __FILE__, __func__, "name ok: %s\n", fileName);
    FsResourceManager::getInstance()->addCleanupHandler(deleteFile_CleanupHandler, fileName);
}

FsResultSet_OnFile::~FsResultSet_OnFile() {
    delete writer;
    writer = nullptr;
    if (reader == nullptr) fscanner::Env::Current()->removeFile(fileName);
    // The handler holds this very pointer; it must not outlive the name.
    FsResourceManager::getInstance()->removeCleanupHandler(deleteFile_CleanupHandler, fileName);
    kelm_free(fileName);
}

FsResultSetWriter* FsResultSet_OnFile::getWriter() {
    getQvLogFs()->traceMID(__LINE__, __FILE__, __func__, "%s - getWriter for file: '%s'",
                           "FsResultSet_OnFile", fileName);
    if (writer == nullptr) writer = new FsResultSetWriter_OnFile(fileName);
    return writer;
}

FsResultSetReader* FsResultSet_OnFile::getReader() {
    getQvLogFs()->traceMID(__LINE__, __FILE__, __func__, "%s - getReader for file: '%s'",
                           "FsResultSet_OnFile", fileName);
    if (reader == nullptr) {
        if (writer != nullptr) writer->close();
        reader = new FsResultSetReader_OnFile(fileName);
    }
    return reader;
}
