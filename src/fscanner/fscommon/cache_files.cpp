#include "fscanner/fscommon/cache_files.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>
#include <cwchar>
#include <new>

#include "base/kelmem.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/env.h"

using fscanner::Env;

namespace cachefiles {

namespace {

// The modes the files have always had: stdio's for the side files written
// as streams ("wb"), the mapped files' for the update flag.
const mode_t kSideFileMode = 0666;
const mode_t kUpdateFlagMode = 0660;

// The side files are replaced whole, as fopen "wb" would.
int openForReplacing(Env* env, char const* path) {
    return env->openFile(path, O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, kSideFileMode);
}

// Writes bytes over a new file at path and closes it; false (errno set) on
// any failure, the close's included.  *opened, when given, tells whether the
// file could be made at all.
bool replaceFile(char const* path, std::string const& bytes, bool* opened = nullptr) {
    Env* env = Env::Current();
    int fd = openForReplacing(env, path);
    if (opened != nullptr) *opened = fd != -1;
    if (fd == -1) return false;
    bool ok = fscanner::WriteFully(env, fd, bytes.data(), bytes.size());
    int reason = errno;
    ok = env->closeFile(fd) == 0 && ok;
    if (!ok && reason != 0) errno = reason;
    return ok;
}

// Whole content of a side file; false when it cannot be opened or read.
bool readSideFile(char const* path, std::string* content) {
    if (path == nullptr) {
        errno = EINVAL;
        return false;
    }
    return fscanner::ReadFileToString(Env::Current(), path, content);
}

}  // namespace

// ------------------------------------------------------------------- names

wchar_t* joinName(wchar_t const* a, wchar_t const* b, wchar_t const* c) {
    if (a == nullptr || b == nullptr || c == nullptr) return nullptr;
    size_t la = wcslen(a), lb = wcslen(b), lc = wcslen(c);
    wchar_t* out = static_cast<wchar_t*>(kelm_malloc((la + lb + lc + 1) * sizeof(wchar_t)));
    if (out == nullptr) return nullptr;
    wmemcpy(out, a, la);
    wmemcpy(out + la, b, lb);
    wmemcpy(out + la + lb, c, lc + 1);
    return out;
}

wchar_t* tableDataName(wchar_t const* table) { return joinName(table, TABLE_DATA_SUFFIX); }

wchar_t* tableIndexListName(wchar_t const* table) { return joinName(table, TABLE_INDEX_LIST_SUFFIX); }

wchar_t* tableLockName(wchar_t const* table) { return joinName(table, TABLE_LOCK_SUFFIX); }

wchar_t* indexFileName(wchar_t const* index) { return joinName(index, INDEX_SUFFIX); }

wchar_t* compactionName(wchar_t const* name) { return joinName(name, COMPACTION_SUFFIX); }

wchar_t* tablePointerPath(wchar_t const* directory, wchar_t const* table) {
    return joinName(directory, table, TABLE_POINTER_SUFFIX);
}

wchar_t* cacheFileName(wchar_t const* directory, wchar_t const* name, wchar_t const* suffix) {
    if (directory == nullptr || name == nullptr || suffix == nullptr) return nullptr;
    size_t ld = wcslen(directory);
    bool needSeparator = ld == 0 || directory[ld - 1] != L'/';
    size_t total = ld + (needSeparator ? 1 : 0) + wcslen(name) + wcslen(suffix) + 1;
    wchar_t* out = new (std::nothrow) wchar_t[total];
    if (out == nullptr) return nullptr;
    wcscpy(out, directory);
    if (needSeparator) wcscat(out, L"/");
    wcscat(out, name);
    wcscat(out, suffix);
    return out;
}

wchar_t* counterPath(wchar_t const* cacheDirectory, wchar_t const* directoriesTable) {
    return cacheFileName(cacheDirectory, directoriesTable, COUNTER_SUFFIX);
}

wchar_t* updateFlagPath(wchar_t const* cacheDirectory, wchar_t const* directoriesTable) {
    return cacheFileName(cacheDirectory, directoriesTable, UPDATE_FLAG_SUFFIX);
}

wchar_t* catalogSetPath(wchar_t const* cacheDirectory) {
    return cacheFileName(cacheDirectory, CATALOG_SET_NAME, L"");
}

wchar_t* excludeDigestsPath(wchar_t const* cacheDirectory) {
    return cacheFileName(cacheDirectory, EXCLUDE_DIGESTS_NAME, L"");
}

wchar_t* providerDigestPath(wchar_t const* cacheDirectory) {
    return joinName(cacheDirectory, L"/", PROVIDER_DIGEST_NAME);
}

wchar_t* accessMutexName(wchar_t const* cacheDirectory) {
    wchar_t* name = joinName(cacheDirectory, ACCESS_MUTEX_SUFFIX);
    if (name == nullptr) return nullptr;
    for (wchar_t* p = name; *p != L'\0'; ++p) {
        if (*p == L'/' || *p == L':') *p = L'_';
    }
    return name;
}

std::string folderLogPath(char const* traceDirectory) {
    std::string path = traceDirectory != nullptr ? traceDirectory : "";
    path += "/";
    path += FOLDER_LOG_NAME;
    return path;
}

// -------------------------------------------------------------- side files

bool readCounter(char const* path, uint32_t* value) {
    std::string bytes;
    if (!readSideFile(path, &bytes)) return false;
    if (bytes.size() < COUNTER_SIZE) return false;
    *value = codec::decodeFixed32(bytes.data());
    return true;
}

bool writeCounter(char const* path, uint32_t value) {
    if (path == nullptr) {
        errno = EINVAL;
        return false;
    }
    Env* env = Env::Current();
    int fd = env->openFile(path, O_RDWR | O_CLOEXEC);
    if (fd == -1) fd = openForReplacing(env, path);
    if (fd == -1) return false;
    std::string bytes;
    codec::putFixed32(&bytes, value);
    bool ok = fscanner::WriteFully(env, fd, bytes.data(), bytes.size());
    // A longer file (not one of ours) is cut to the four bytes, as a new one
    // would be.
    ok = ok && env->truncateFile(fd, static_cast<off_t>(COUNTER_SIZE)) == 0;
    int reason = errno;
    ok = env->closeFile(fd) == 0 && ok;
    if (!ok) errno = reason;
    return ok;
}

bool createUpdateFlag(char const* path) {
    if (path == nullptr) return false;
    Env* env = Env::Current();
    // Made anew: a flag left by a crash is replaced, not reused.
    env->removeFile(path);
    int fd = env->openFile(path, O_RDWR | O_CREAT | O_TRUNC | O_NONBLOCK | O_CLOEXEC, kUpdateFlagMode);
    if (fd == -1) return false;
    env->closeFile(fd);
    return true;
}

bool updateFlagPresent(char const* path) {
    if (path == nullptr) return false;
    Env* env = Env::Current();
    int fd = env->openFile(path, O_RDWR | O_NONBLOCK | O_CLOEXEC);
    if (fd == -1) return false;
    env->closeFile(fd);
    return true;
}

bool removeSideFile(char const* path) {
    if (path == nullptr) return false;
    return Env::Current()->removeFile(path) == 0;
}

bool readProviderDigest(char const* path, unsigned char (&digest)[DIGEST_SIZE], bool* exact) {
    if (exact != nullptr) *exact = false;
    std::string bytes;
    if (!readSideFile(path, &bytes)) return false;
    if (bytes.size() < DIGEST_SIZE) {
        // What there is has been read, as a short read leaves it.
        std::memcpy(digest, bytes.data(), bytes.size());
        return false;
    }
    std::memcpy(digest, bytes.data(), DIGEST_SIZE);
    if (exact != nullptr) *exact = bytes.size() == DIGEST_SIZE;
    return true;
}

bool writeProviderDigest(char const* path, unsigned char const (&digest)[DIGEST_SIZE]) {
    if (path == nullptr) return false;
    return replaceFile(path, std::string(reinterpret_cast<char const*>(digest), DIGEST_SIZE));
}

bool readExcludeDigests(char const* path, std::vector<ExcludeDigest>* records, ReadEnd* end,
                        uint32_t* damagedLength) {
    *end = END_OF_FILE;
    std::string bytes;
    if (!readSideFile(path, &bytes)) return false;
    size_t at = 0;
    while (at < bytes.size()) {
        if (bytes.size() - at < EXCLUDE_LENGTH_SIZE) {
            *end = CUT_SHORT;
            break;
        }
        uint32_t length = codec::decodeFixed32(bytes.data() + at);
        if (length > EXCLUDE_KEY_LIMIT) {
            *end = DAMAGED_RECORD;
            *damagedLength = length;
            break;
        }
        size_t recordSize = EXCLUDE_LENGTH_SIZE + length + DIGEST_SIZE;
        if (bytes.size() - at < recordSize) {
            *end = CUT_SHORT;
            break;
        }
        ExcludeDigest record;
        record.key.assign(bytes.data() + at + EXCLUDE_LENGTH_SIZE, length);
        std::memcpy(record.digest, bytes.data() + at + EXCLUDE_LENGTH_SIZE + length, DIGEST_SIZE);
        records->push_back(record);
        at += recordSize;
    }
    return true;
}

bool writeExcludeDigests(char const* path, std::vector<ExcludeDigest> const& records, bool* opened) {
    *opened = false;
    if (path == nullptr) return false;
    std::string bytes;
    for (ExcludeDigest const& record : records) {
        codec::putFixed32(&bytes, static_cast<uint32_t>(record.key.size()));
        bytes.append(record.key);
        bytes.append(reinterpret_cast<char const*>(record.digest), DIGEST_SIZE);
    }
    return replaceFile(path, bytes, opened);
}

bool readCatalogSet(char const* path, std::vector<std::wstring>* records, ReadEnd* end,
                    uint32_t* damagedCount) {
    *end = END_OF_FILE;
    std::string bytes;
    if (!readSideFile(path, &bytes)) return false;
    const size_t charSize = sizeof(uint32_t);
    size_t at = 0;
    while (at < bytes.size()) {
        if (bytes.size() - at < CATALOG_COUNT_SIZE) {
            *end = CUT_SHORT;
            break;
        }
        uint32_t count = codec::decodeFixed32(bytes.data() + at);
        if (count > CATALOG_RECORD_LIMIT) {
            *end = DAMAGED_RECORD;
            *damagedCount = count;
            break;
        }
        size_t recordSize = CATALOG_COUNT_SIZE + static_cast<size_t>(count) * charSize;
        if (bytes.size() - at < recordSize) {
            *end = CUT_SHORT;
            break;
        }
        std::wstring text;
        text.reserve(count);
        for (uint32_t i = 0; i < count; ++i)
            text.push_back(static_cast<wchar_t>(
                codec::decodeFixed32(bytes.data() + at + CATALOG_COUNT_SIZE + i * charSize)));
        records->push_back(text);
        at += recordSize;
    }
    return true;
}

bool writeCatalogSet(char const* path, std::vector<std::wstring> const& records, bool* opened) {
    *opened = false;
    if (path == nullptr) return false;
    std::string bytes;
    for (std::wstring const& text : records) {
        codec::putFixed32(&bytes, static_cast<uint32_t>(text.size()));
        for (wchar_t c : text) codec::putFixed32(&bytes, static_cast<uint32_t>(c));
    }
    return replaceFile(path, bytes, opened);
}

}  // namespace cachefiles
