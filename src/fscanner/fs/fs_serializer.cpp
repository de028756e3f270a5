#include "fscanner/fs/fs_serializer.h"

#include <climits>
#include <cstring>
#include <new>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/sysfile.h"

namespace {
const int kNoError = 0;
const int kError = -1;
}  // namespace

FsSerializator_OnFile::FsSerializator_OnFile(AbstractFile* file, bool closeAtEnd)
    : file(file), closeAtEnd(closeAtEnd), lastError(file == nullptr ? kError : kNoError) {
    std::memset(shortString, 0, sizeof(shortString));
}

FsSerializator_OnFile::~FsSerializator_OnFile() {
    if (closeAtEnd && file != nullptr) file->close();
    utf8Buffer.release();
    spareBuffer.release();
}

bool FsSerializator_OnFile::saveUnsigned32(unsigned int value) {
    if (lastError != kNoError) return false;
    char bytes[resultfile::kUnsigned32Size];
    codec::encodeBig32(bytes, static_cast<uint32_t>(value));
    if (file->write(bytes, sizeof(bytes)) != sizeof(bytes)) lastError = kError;
    return lastError == kNoError;
}

bool FsSerializator_OnFile::saveUnsigned64(unsigned long long value) {
    if (lastError != kNoError) return false;
    char bytes[resultfile::kUnsigned64Size];
    codec::encodeBig64(bytes, static_cast<uint64_t>(value));
    if (file->write(bytes, sizeof(bytes)) != sizeof(bytes)) lastError = kError;
    return lastError == kNoError;
}

bool FsSerializator_OnFile::saveInteger32(int value) {
    return saveUnsigned32(static_cast<unsigned int>(value));
}

bool FsSerializator_OnFile::saveString(wchar_t const* text) {
    if (lastError != kNoError) return false;
    if (text == nullptr) {
        // The format has no form for a missing string that a reader would
        // give back as such; refuse rather than write a record nobody can read.
        getQvLogFs()->traceMAX(__LINE__, __FILE__, __func__,
                               "FsSerializator_OnFile::saveString - null string refused\n");
        lastError = kError;
        return false;
    }
    size_t characters = std::wcslen(text);
    if (characters > (UINT_MAX - 2) / 6) {
        lastError = kError;
        return false;
    }
    utils::stringToUTF8(utf8Buffer, text);
    // stringToUTF8 grows the buffer to 6 bytes per character plus 1; a buffer
    // that could not grow may still hold an older text, which must not go out.
    if (utf8Buffer.get() == nullptr ||
        utf8Buffer.capacity() < static_cast<unsigned int>(characters) * 6 + 1) {
        lastError = kError;
        return false;
    }
    unsigned int bytes =
        static_cast<unsigned int>(std::strlen(reinterpret_cast<const char*>(utf8Buffer.get())));
    saveUnsigned32(bytes + 1);
    if (lastError == kNoError && bytes > 0) {
        if (file->write(utf8Buffer.get(), bytes) != bytes) lastError = kError;
    }
    return lastError == kNoError;
}

unsigned int FsSerializator_OnFile::loadUnsigned32() {
    if (lastError != kNoError) return 0;
    char bytes[resultfile::kUnsigned32Size];
    if (file->read(bytes, sizeof(bytes)) != sizeof(bytes)) {
        lastError = kError;
        return 0;
    }
    return codec::decodeBig32(bytes);
}

unsigned long long FsSerializator_OnFile::loadUnsigned64() {
    if (lastError != kNoError) return 0;
    char bytes[resultfile::kUnsigned64Size];
    if (file->read(bytes, sizeof(bytes)) != sizeof(bytes)) {
        lastError = kError;
        return 0;
    }
    return codec::decodeBig64(bytes);
}

int FsSerializator_OnFile::loadInteger32() {
    return static_cast<int>(loadUnsigned32());
}

bool FsSerializator_OnFile::bytesAvailable(unsigned int length) {
    long position = file->tell();
    if (position < 0 || !file->seek(0, SEEK_FROM_END)) return true;
    long end = file->tell();
    file->seek(position, SEEK_FROM_START);
    return end >= position && static_cast<unsigned long>(end - position) >= length;
}

wchar_t* FsSerializator_OnFile::loadString() {
    unsigned int count = loadUnsigned32();
    if (lastError != kNoError || count == 0) return nullptr;
    unsigned int length = count - 1;

    unsigned char* block = shortString;
    if (count > resultfile::kInlineStringCount) {
        // A damaged count can promise gigabytes: check it against what the
        // file really holds before anything is allocated.
        if (!bytesAvailable(length)) {
            getQvLogFs()->traceMAX(__LINE__, __FILE__, __func__,
                                   "FsSerializator_OnFile::loadString - string count %u runs "
                                   "past the end of the file\n",
                                   count);
            lastError = kError;
            return nullptr;
        }
        block = new (std::nothrow) unsigned char[count];
        if (block == nullptr) {
            lastError = kError;
            return nullptr;
        }
    }
    if (count > 1 && file->read(block, length) != length) {
        lastError = kError;
        if (block != shortString) delete[] block;
        return nullptr;
    }
    block[length] = 0;

    // At most one character per byte, so count characters always suffice.
    wchar_t* text = new (std::nothrow) wchar_t[count];
    if (text != nullptr) {
        utils::utf8ToWideChar(text, count, block);
    } else {
        lastError = kError;
    }
    if (block != shortString) delete[] block;
    return text;
}

int FsSerializator_OnFile::getLastError() {
    return lastError;
}

void FsSerializator_OnFile::reset() {
    lastError = kNoError;
}

// ---- the record layout ------------------------------------------------------

int FsFileInfo::saveObject(FsSerializator& serializator) const {
    if (path == nullptr || name == nullptr || md5 == nullptr || sha256 == nullptr) {
        // saveString refuses null and latches the error, so nothing of this
        // record reaches the file.
        serializator.saveString(nullptr);
        return serializator.getLastError();
    }
    serializator.saveString(path);
    serializator.saveString(name);
    serializator.saveString(md5);
    serializator.saveString(sha256);
    serializator.saveUnsigned32(validMask);
    if (validMask & VALID_ATTR) serializator.saveUnsigned32(attr);
    if (validMask & VALID_SIZE) serializator.saveUnsigned64(size);
    if (validMask & VALID_DEVICE) serializator.saveUnsigned32(device);
    if (validMask & VALID_GROUP_ID) serializator.saveUnsigned32(groupId);
    if (validMask & VALID_USER_ID) serializator.saveUnsigned32(userId);
    if (validMask & VALID_INODE) serializator.saveUnsigned32(iNode);
    if (validMask & VALID_LAST_ACCESS_TIME)
        serializator.saveUnsigned32(static_cast<unsigned int>(lastAccessTime));
    if (validMask & VALID_CREATE_TIME)
        serializator.saveUnsigned32(static_cast<unsigned int>(createTime));
    if (validMask & VALID_LAST_MODIFY_TIME)
        serializator.saveUnsigned32(static_cast<unsigned int>(lastModifyTime));
    if (validMask & VALID_LINK_COUNT) serializator.saveUnsigned32(linkCount);
    if (validMask & VALID_CRC32) serializator.saveUnsigned32(crc32);
    if (validMask & VALID_Q32) serializator.saveUnsigned32(q32);
    return serializator.getLastError();
}

namespace {
// Times are stored as their low 32 bits; they come back signed, so that a
// 64-bit long reads what a 32-bit one would.
long loadTime(FsSerializator& serializator) {
    return static_cast<long>(static_cast<int32_t>(serializator.loadUnsigned32()));
}
}  // namespace

int FsFileInfo::loadObject(FsSerializator& serializator) {
    clear();
    // Every item is asked for even after a failure: the serialiser answers 0
    // or null at once once its error is stored.
    wchar_t* loadedPath = serializator.loadString();
    wchar_t* loadedName = serializator.loadString();
    wchar_t* loadedMD5 = serializator.loadString();
    wchar_t* loadedSHA256 = serializator.loadString();
    delete[] path;
    path = loadedPath;
    delete[] name;
    name = loadedName;
    delete[] md5;
    md5 = loadedMD5;
    delete[] sha256;
    sha256 = loadedSHA256;

    validMask = serializator.loadUnsigned32();
    if (validMask & VALID_ATTR) attr = serializator.loadUnsigned32();
    if (validMask & VALID_SIZE) size = serializator.loadUnsigned64();
    if (validMask & VALID_DEVICE) device = serializator.loadUnsigned32();
    if (validMask & VALID_GROUP_ID) groupId = serializator.loadUnsigned32();
    if (validMask & VALID_USER_ID) userId = serializator.loadUnsigned32();
    if (validMask & VALID_INODE) iNode = serializator.loadUnsigned32();
    if (validMask & VALID_LAST_ACCESS_TIME) lastAccessTime = loadTime(serializator);
    if (validMask & VALID_CREATE_TIME) createTime = loadTime(serializator);
    if (validMask & VALID_LAST_MODIFY_TIME) lastModifyTime = loadTime(serializator);
    if (validMask & VALID_LINK_COUNT) linkCount = serializator.loadUnsigned32();
    if (validMask & VALID_CRC32) crc32 = serializator.loadUnsigned32();
    if (validMask & VALID_Q32) q32 = serializator.loadUnsigned32();
    return serializator.getLastError();
}
