#include "fscanner/fscommon/table.h"

#include <cerrno>
#include <cstring>
#include <cwchar>
#include <cwctype>
#include <string>

#include "base/kelmem.h"
#include "fscanner/fscommon/cache_files.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/keyhash.h"
#include "fscanner/fscommon/resolvepath.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/table_format.h"
#include "fscanner/fscommon/table_verify.h"
#include "fscanner/fscommon/wildcard.h"
#include "fscanner/fscommon/utils.h"

using namespace tableformat;

namespace {

// The mark upperAsciiTable() holds for bytes no plain ASCII text holds; no
// character's upper case has this bit.
const uint32_t kNotPlainAscii = keyhash::kNotPlainMark;

// Closes and deletes file, if there is one, and leaves the pointer null.
void closeAndDrop(AbstractFile*& file) {
    if (file == nullptr) return;
    file->close();
    delete file;
    file = nullptr;
}

// The first index of list whose name, as nameOf(index) gives it, is name;
// taken out of list when remove.  Null for a null name or none.
template <typename NameOf>
Index* findIndex(std::vector<Index*>& list, NameOf nameOf, wchar_t const* name, bool remove) {
    if (name == nullptr) return nullptr;
    for (auto it = list.begin(); it != list.end(); ++it) {
        wchar_t const* own = nameOf(*it);
        if (own != nullptr && wcscmp(own, name) == 0) {
            Index* found = *it;
            if (remove) list.erase(it);
            return found;
        }
    }
    return nullptr;
}

// a + b (+ c) in a new kelm_malloc block; null when any part is null.
wchar_t* wideJoin(wchar_t const* a, wchar_t const* b, wchar_t const* c = L"") {
    if (a == nullptr || b == nullptr || c == nullptr) return nullptr;
    size_t la = wcslen(a), lb = wcslen(b), lc = wcslen(c);
    wchar_t* out = static_cast<wchar_t*>(kelm_malloc((la + lb + lc + 1) * sizeof(wchar_t)));
    if (out == nullptr) return nullptr;
    std::memcpy(out, a, la * sizeof(wchar_t));
    std::memcpy(out + la, b, lb * sizeof(wchar_t));
    std::memcpy(out + la + lb, c, (lc + 1) * sizeof(wchar_t));
    return out;
}

void unlinkWide(wchar_t const* path) {
    if (path == nullptr) return;
    char* narrow = utils::myWcsToMbsString(path);
    if (narrow != nullptr && narrow[0] != 0) fscanner::Env::Current()->removeFile(narrow);
    delete[] narrow;
}

// Appends a name as the format stores it: byte length, then 4-byte characters.
void putWideName(std::string* out, wchar_t const* text) {
    uint32_t chars = text == nullptr ? 0 : static_cast<uint32_t>(wcslen(text));
    codec::putFixed32(out, chars * kWideCharSize);
    for (uint32_t i = 0; i < chars; ++i) codec::putFixed32(out, static_cast<uint32_t>(text[i]));
}

bool writeAll(AbstractFile* file, std::string const& bytes) {
    if (bytes.empty()) return true;
    return file->write(const_cast<char*>(bytes.data()), static_cast<unsigned int>(bytes.size())) ==
           bytes.size();
}

bool readWord(AbstractFile* file, uint32_t* value) {
    char buf[4];
    if (file->read(buf, 4) != 4) return false;
    *value = codec::decodeFixed32(buf);
    return true;
}

// Reads a stored name of byteLength bytes into a new kelm_malloc wide string.
// Null for a length that is not whole characters or runs past the file.
wchar_t* readWideName(AbstractFile* file, uint32_t byteLength) {
    if (byteLength % kWideCharSize != 0) return nullptr;
    unsigned int fileSize = 0;
    long here = file->tell();
    if (!file->seek(0, SEEK_FROM_END)) return nullptr;
    fileSize = static_cast<unsigned int>(file->tell());
    file->seek(here, SEEK_FROM_START);
    if (byteLength > fileSize - static_cast<unsigned int>(here)) return nullptr;
    uint32_t chars = byteLength / kWideCharSize;
    std::string raw(byteLength, '\0');
    if (byteLength != 0 && file->read(&raw[0], byteLength) != byteLength) return nullptr;
    wchar_t* out = static_cast<wchar_t*>(kelm_malloc((chars + 1) * sizeof(wchar_t)));
    if (out == nullptr) return nullptr;
    for (uint32_t i = 0; i < chars; ++i)
        out[i] = static_cast<wchar_t>(codec::decodeFixed32(raw.data() + i * kWideCharSize));
    out[chars] = 0;
    return out;
}

unsigned long long integerValue(Field* field) {
    switch (field->getType()) {
        case FIELD_INT8: return static_cast<Int8Field*>(field)->value();
        case FIELD_INT16: return static_cast<Int16Field*>(field)->value();
        case FIELD_INT32: return static_cast<Int32Field*>(field)->value();
        case FIELD_INT64: return static_cast<Int64Field*>(field)->value();
        default: return 0;
    }
}

size_t wideLength(wchar_t const* text) { return text == nullptr ? 0 : wcslen(text); }

// Room for length more bytes at the end of file.  The table files are
// LinuxMmFile objects, which can promise that; any other file answers by its
// write alone.
bool reserveTail(AbstractFile* file, unsigned int length) {
    LinuxMmFile* mapped = dynamic_cast<LinuxMmFile*>(file);
    return mapped == nullptr || mapped->reserve(length);
}

}  // namespace

// ---- compressed integers ------------------------------------------------------

int compressInt(unsigned long long value, char* buffer, int size) {
    return codec::encodeCompressedBackward(value, buffer, size);
}

unsigned long long decompressInt(char* buffer) {
    uint64_t value = 0;
    codec::decodeCompressed(buffer, codec::kMaxCompressedLength, &value);
    return value;
}

// ---- hash ---------------------------------------------------------------------

int hash(wchar_t const* key, int buckets) {
    uint32_t acc = 0;  // unsigned arithmetic wraps as the signed accumulator does
    if (key != nullptr) {
        size_t i = 0;
        do {
            acc = acc * 37u + static_cast<uint32_t>(key[i]);
        } while (key[i++] != 0);
    }
    return hash(acc, buckets);
}

int hash(unsigned int value, int buckets) {
    int32_t v = static_cast<int32_t>(value);
    int r = v % buckets;
    if (r < 0) r += buckets;
    return r;
}

// ---- Index --------------------------------------------------------------------

Index::Index(wchar_t const* idxName, wchar_t const* dir, wchar_t const* fldName)
    : file(nullptr), indexName(nullptr), fieldName(nullptr), indexFileName(nullptr), fullPath(nullptr) {
    if (idxName == nullptr || dir == nullptr || fldName == nullptr) return;
    indexName = wideDuplicate(idxName);
    fieldName = wideDuplicate(fldName);
    indexFileName = cachefiles::indexFileName(idxName);
    size_t dl = wcslen(dir);
    bool hasSeparator = dl > 0 && dir[dl - 1] == L'/';
    fullPath = wideJoin(dir, hasSeparator ? L"" : L"/", indexFileName != nullptr ? indexFileName : nullptr);
    if (indexName == nullptr || fieldName == nullptr || indexFileName == nullptr || fullPath == nullptr) {
        kelm_free(indexName);
        kelm_free(fieldName);
        kelm_free(indexFileName);
        kelm_free(fullPath);
        indexName = fieldName = indexFileName = fullPath = nullptr;
    }
}

Index::Index(const Index& other)
    : file(nullptr),
      indexName(wideDuplicate(other.indexName)),
      fieldName(wideDuplicate(other.fieldName)),
      indexFileName(wideDuplicate(other.indexFileName)),
      fullPath(wideDuplicate(other.fullPath)) {}

Index::~Index() {
    close();
    kelm_free(indexName);
    kelm_free(fieldName);
    kelm_free(indexFileName);
    kelm_free(fullPath);
}

bool Index::create() {
    if (fullPath == nullptr || file != nullptr) return false;
    file = SysFactory::createMmFile(fullPath);
    if (file == nullptr) return false;
    if (!file->create()) {
        delete file;
        file = nullptr;
        return false;
    }
    return init();
}

bool Index::init() {
    if (file == nullptr) return false;
    std::string slots(static_cast<size_t>(BUCKETS) * 8, static_cast<char>(0xFF));
    if (!file->seek(0, SEEK_FROM_START)) return false;
    return writeAll(file, slots);
}

bool Index::open() {
    if (fullPath == nullptr || file != nullptr) return false;
    file = SysFactory::createMmFile(fullPath);
    if (file == nullptr) return false;
    if (!file->open()) {
        delete file;
        file = nullptr;
        return false;
    }
    return true;
}

bool Index::close() {
    if (file == nullptr) return false;
    file->close();
    delete file;
    file = nullptr;
    return true;
}

bool Index::erase() {
    if (fullPath == nullptr || file != nullptr) return false;
    return removeFile(fullPath) == 0;
}

bool Index::read(unsigned int slot, unsigned int* id, unsigned int* next) {
    if (file == nullptr) return false;
    // A lookup reads a slot here and there: in place, where the mapping has
    // it whole (no caller reads on from where this read ends).
    if (const char* both = mappedBytes(file, static_cast<uint64_t>(slot) * 8, 8)) {
        *id = codec::decodeFixed32(both);
        *next = codec::decodeFixed32(both + 4);
        return true;
    }
    if (!file->seek(static_cast<long>(static_cast<unsigned long long>(slot) * 8), SEEK_FROM_START)) return false;
    char both[8];
    if (file->read(both, 8) != 8) return false;
    *id = codec::decodeFixed32(both);
    *next = codec::decodeFixed32(both + 4);
    return true;
}

bool Index::reserveSlot() {
    if (file == nullptr) return false;
    return reserveTail(file, 8);
}

bool Index::write(unsigned int bucket, unsigned int id) {
    if (file == nullptr) return false;
    unsigned int headId, headNext;
    if (!read(bucket, &headId, &headNext)) return false;
    char word[8];
    codec::encodeFixed32(word, id);
    if (headId == EMPTY) {
        file->seek(static_cast<long>(bucket) * 8, SEEK_FROM_START);
        return file->write(word, 4) == 4;
    }
    if (!file->seek(0, SEEK_FROM_END)) return false;
    uint32_t newSlot = static_cast<uint32_t>(file->tell() / 8);
    char moved[8];
    codec::encodeFixed32(moved, headId);
    codec::encodeFixed32(moved + 4, headNext);
    if (file->write(moved, 8) != 8) return false;
    file->seek(static_cast<long>(bucket) * 8, SEEK_FROM_START);
    codec::encodeFixed32(word + 4, newSlot);
    return file->write(word, 8) == 8;
}

// ---- FS_Table: construction ---------------------------------------------------

FS_Table::FS_Table(wchar_t const* tableName, wchar_t const* dir, bool compressedIntegers)
    : dataFile(nullptr),
      pointerFile(nullptr),
      scratch(nullptr),
      scratchCapacity(0),
      utf8(),
      name(nullptr),
      dataFileName(nullptr),
      directory(nullptr),
      dataPath(nullptr),
      pointerPath(nullptr),
      indexListName(nullptr),
      bitmapSize(0),
      compressed(compressedIntegers),
      schema(),
      indexes(),
      recordSets(),
      mutex(nullptr),
      guard(nullptr) {
    if (tableName == nullptr || dir == nullptr) return;
    wchar_t* real = resolvePath(dir, false);
    if (real == nullptr) return;
    size_t rl = wcslen(real);
    directory = wideJoin(real, (rl > 0 && real[rl - 1] == L'/') ? L"" : L"/");
    kelm_free(real);
    name = wideDuplicate(tableName);
    dataFileName = cachefiles::tableDataName(tableName);
    dataPath = wideJoin(directory, dataFileName);
    pointerPath = cachefiles::tablePointerPath(directory, tableName);
    indexListName = cachefiles::tableIndexListName(tableName);
    wchar_t* lockName = cachefiles::tableLockName(tableName);
    if (directory == nullptr || name == nullptr || dataFileName == nullptr || dataPath == nullptr ||
        pointerPath == nullptr || indexListName == nullptr || lockName == nullptr) {
        kelm_free(lockName);
        freeNames();
        return;
    }
    mutex = SysFactory::createMutex(lockName);
    kelm_free(lockName);
}

void FS_Table::freeNames() {
    kelm_free(name);
    kelm_free(dataFileName);
    kelm_free(directory);
    kelm_free(dataPath);
    kelm_free(pointerPath);
    kelm_free(indexListName);
    name = dataFileName = directory = dataPath = pointerPath = indexListName = nullptr;
}

FS_Table::~FS_Table() {
    freeHashIndexList(indexes);
    closeAndDrop(dataFile);
    closeAndDrop(pointerFile);
    freeNames();
    kelm_free(scratch);
    if (mutex != nullptr) {
        // Deleting the lock object closes and unlinks the lock file.
        delete mutex;
        mutex = nullptr;
    }
    // Cursors are owned by the table.
    deleteRecordSets();
    dropGuard();
}

wchar_t* FS_Table::indexListPath() { return wideJoin(directory, indexListName); }

unsigned int FS_Table::headerSize() {
    unsigned int size = kFixedHeaderSize;
    for (unsigned int i = 0; i < schema.count(); ++i)
        size += kDescriptorFixedSize + static_cast<unsigned int>(wideLength(schema.at(i)->getName())) * kWideCharSize;
    return size;
}

void FS_Table::setBit(unsigned int index, unsigned char* buffer) {
    buffer[index / 8] |= static_cast<unsigned char>(0x80u >> (index % 8));
}

bool FS_Table::checkBit(unsigned int index, unsigned char const* buffer) {
    return (buffer[index / 8] & (0x80u >> (index % 8))) != 0;
}

bool FS_Table::growScratch(unsigned int characters) {
    if (characters <= scratchCapacity) return true;
    wchar_t* grown = static_cast<wchar_t*>(kelm_realloc(scratch, characters * sizeof(wchar_t)));
    if (grown == nullptr) return false;
    scratch = grown;
    scratchCapacity = characters;
    return true;
}

// ---- FS_Table: lifecycle ------------------------------------------------------

bool FS_Table::addField(wchar_t const* fieldName, unsigned int type) {
    if (dataFile != nullptr || pointerFile != nullptr) return false;
    lastSkim.built = false;
    return schema.add(fieldName, type);
}

bool FS_Table::create() {
    if (dataPath == nullptr || pointerPath == nullptr) return false;
    if (dataFile != nullptr || pointerFile != nullptr) return false;
    if (schema.count() > kMaxFields) return false;  // the presence bitmap holds 256 bits
    dataFile = SysFactory::createMmFile(dataPath);
    pointerFile = SysFactory::createMmFile(pointerPath);
    if (dataFile == nullptr || pointerFile == nullptr || !dataFile->create() || !pointerFile->create()) {
        delete dataFile;
        delete pointerFile;
        dataFile = pointerFile = nullptr;
        return false;
    }
    std::string header;
    codec::putFixed32(&header, 0);  // stored count
    codec::putFixed32(&header, 0);  // deleted count
    codec::putFixed32(&header, schema.count());
    for (unsigned int i = 0; i < schema.count(); ++i) {
        codec::putFixed32(&header, schema.at(i)->getType());
        putWideName(&header, schema.at(i)->getName());
    }
    if (!writeAll(dataFile, header)) {
        int reason = errno;  // a full disk, for the caller to report
        close();
        errno = reason;
        return false;
    }
    bitmapSize = bitmapBytes(schema.count());
    // A new table has no indexes; index files of an earlier table stay.
    wchar_t* listPath = indexListPath();
    unlinkWide(listPath);
    kelm_free(listPath);
    return true;
}

bool FS_Table::open() {
    if (dataPath == nullptr || pointerPath == nullptr) return false;
    if (dataFile != nullptr || pointerFile != nullptr) return false;
    // The columns may change below.
    lastSkim.built = false;
    dataFile = SysFactory::createMmFile(dataPath);
    pointerFile = SysFactory::createMmFile(pointerPath);
    if (dataFile == nullptr || pointerFile == nullptr || !dataFile->open() || !pointerFile->open()) {
        if (dataFile != nullptr) dataFile->close();
        if (pointerFile != nullptr) pointerFile->close();
        delete dataFile;
        delete pointerFile;
        dataFile = pointerFile = nullptr;
        return false;
    }
    // The header is trusted as to its values; what is checked is only that it
    // lies inside the file, so a truncated or foreign file fails cleanly.
    uint32_t stored, deleted, fieldCount;
    bool ok = readWord(dataFile, &stored) && readWord(dataFile, &deleted) && readWord(dataFile, &fieldCount) &&
              fieldCount <= kMaxFields;
    for (uint32_t i = 0; ok && i < fieldCount; ++i) {
        uint32_t type, nameBytes;
        ok = readWord(dataFile, &type) && readWord(dataFile, &nameBytes);
        if (!ok) break;
        wchar_t* fieldName = readWideName(dataFile, nameBytes);
        if (fieldName == nullptr) {
            ok = false;
            break;
        }
        schema.add(fieldName, type);
        kelm_free(fieldName);
    }
    if (!ok) {
        close();
        return false;
    }
    retrieveHashIndexList(indexes);
    // Cursors opened before this call stay owned and go with close().
    bitmapSize = bitmapBytes(fieldCount);
    return true;
}

bool FS_Table::close() {
    closeAndDrop(dataFile);
    closeAndDrop(pointerFile);
    freeHashIndexList(indexes);
    // A cursor never outlives the open table it walks.
    deleteRecordSets();
    schema.removeAll();
    lastSkim.built = false;
    dropGuard();
    return true;
}

bool FS_Table::erase() {
    if (dataFile != nullptr || pointerFile != nullptr) return false;
    if (dataPath == nullptr || pointerPath == nullptr) return false;
    unlinkWide(dataPath);
    unlinkWide(pointerPath);
    // The list is read without the table being open.
    std::vector<Index*> list;
    retrieveHashIndexList(list);
    for (Index* index : list) {
        index->close();
        index->erase();
    }
    freeHashIndexList(list);
    eraseHashIndexList(list);
    return true;
}

// ---- FS_Table: records --------------------------------------------------------

bool FS_Table::writeValue(Field* field) {
    std::string bytes;
    encodeValue(field, &bytes);
    return writeAll(dataFile, bytes);
}

void FS_Table::encodeValue(Field* field, std::string* out) {
    std::string& bytes = *out;
    switch (field->getType()) {
        case FIELD_INT8:
            bytes.push_back(static_cast<char>(static_cast<Int8Field*>(field)->value()));
            break;
        case FIELD_INT16:
        case FIELD_INT32:
        case FIELD_INT64: {
            unsigned long long v = integerValue(field);
            if (compressed) {
                codec::putCompressed(&bytes, v);
            } else if (field->getType() == FIELD_INT16) {
                codec::putFixed16(&bytes, static_cast<uint16_t>(v));
            } else if (field->getType() == FIELD_INT32) {
                codec::putFixed32(&bytes, static_cast<uint32_t>(v));
            } else {
                codec::putFixed64(&bytes, v);
            }
            break;
        }
        case FIELD_TEXT: {
            wchar_t const* text = static_cast<TextField*>(field)->value();
            size_t length = 0;
            if (text != nullptr && utils::stringToUTF8(utf8, text) > 0 && utf8.get() != nullptr)
                length = strlen(reinterpret_cast<char*>(utf8.get()));
            const char* raw = length != 0 ? reinterpret_cast<char*>(utf8.get()) : "";
            if (compressed)
                codec::putPrefixedCompressed(&bytes, raw, length);
            else
                codec::putPrefixed16(&bytes, raw, length);
            break;
        }
        default:
            break;  // type 6 is never stored
    }
}

bool FS_Table::reserveInsert(unsigned int recordBytes) {
    if (!reserveTail(pointerFile, kSlotSize)) return noteWriteFailure(pointerPath);
    if (!reserveTail(dataFile, recordBytes)) return noteWriteFailure(dataPath);
    for (Index* index : indexes) {
        if (!index->reserveSlot()) return noteWriteFailure(index->getIndexFullPathName());
    }
    return true;
}

bool FS_Table::insert(Fields& record) {
    if (dataFile == nullptr || pointerFile == nullptr) return false;
    if (record.count() > kMaxFields) return false;  // the bitmap buffer holds 256 bits
    if (writeFailed()) return false;
    if (!dataFile->seek(0, SEEK_FROM_END) || !pointerFile->seek(0, SEEK_FROM_END)) return false;
    uint32_t offset = static_cast<uint32_t>(dataFile->tell());
    unsigned int id = static_cast<unsigned int>(pointerFile->tell() / kSlotSize);
    std::string slot;
    codec::putFixed32(&slot, offset);
    unsigned char bitmap[kBitmapBufferSize];
    std::memset(bitmap, 0, sizeof bitmap);
    for (unsigned int i = 0; i < record.count(); ++i)
        if (record.at(i)->isNull()) setBit(i, bitmap);
    // The record goes out in one write, after the space of every part of
    // the insert is sure: a full disk must not leave a slot on half a
    // record, or an index without the number, in a table that lives on.
    std::string bytes(reinterpret_cast<char*>(bitmap), bitmapSize <= kBitmapBufferSize ? bitmapSize : 0);
    for (unsigned int i = 0; i < record.count(); ++i) encodeValue(record.at(i), &bytes);
    if (!reserveInsert(static_cast<unsigned int>(bytes.size()))) return false;
    // The slot goes first: a crash between the two writes leaves a slot on a
    // partial record, never a record without a slot.
    if (!writeAll(pointerFile, slot)) return noteWriteFailure(pointerPath);
    if (!writeAll(dataFile, bytes)) return noteWriteFailure(dataPath);
    bool counted = incCount(0);
    bool indexed = hashIndexesUpdate(record, id);
    if (guard != nullptr) guardInsert(record, id);
    return counted && indexed;
}

bool FS_Table::readSlot(unsigned int id, uint32_t* offset) {
    unsigned long long position = static_cast<unsigned long long>(id) * kSlotSize;
    if (position > 0x7FFFFFFFull) return false;
    // In place where the mapping holds the slot whole; a slot it does not
    // is read as before, which leaves the end flag moveFirst looks at.
    if (const char* word = mappedBytes(pointerFile, position, kSlotSize)) {
        *offset = codec::decodeFixed32(word);
        return true;
    }
    if (!pointerFile->seek(static_cast<long>(position), SEEK_FROM_START)) return false;
    return readWord(pointerFile, offset);
}

namespace {

// A stored text's bytes followed by zeros: the lenient UTF-8 decoder needs a
// zero behind the text and may look a few bytes past a sequence cut short,
// so the padding keeps it inside the block whatever the bytes say.  Short
// texts stay on the stack, long ones take a heap block.
class PaddedText {
public:
    PaddedText() = default;
    PaddedText(const PaddedText&) = delete;
    PaddedText& operator=(const PaddedText&) = delete;
    ~PaddedText() {
        if (bytes != local) kelm_free(bytes);
    }
    // Room for length bytes, all zero; false when the heap refuses.
    bool make(uint32_t length) {
        if (length > kInlineTextBytes) {
            bytes = static_cast<unsigned char*>(kelm_malloc(length + 1 + kPad));
            if (bytes == nullptr) {
                bytes = local;
                return false;
            }
        }
        std::memset(bytes, 0, (length > kInlineTextBytes ? length : kInlineTextBytes) + 1 + kPad);
        return true;
    }
    unsigned char* data() { return bytes; }

private:
    static const unsigned int kPad = 8;
    unsigned char local[kInlineTextBytes + 1 + kPad];
    unsigned char* bytes = local;
};

}  // namespace

bool FS_Table::storeText(TextField* field, const unsigned char* bytes, uint32_t length) {
    if (!growScratch(length + 1)) return false;
    // The decoder needs a zero behind the bytes and may look a few bytes past
    // a sequence cut short: a stored text that is not plain ASCII is copied
    // behind a padding of zeros first.
    if (isPlainAscii(bytes, length)) {
        for (uint32_t i = 0; i < length; ++i) scratch[i] = static_cast<wchar_t>(bytes[i]);
        scratch[length] = L'\0';
    } else {
        PaddedText copy;
        if (!copy.make(length)) return false;
        if (length != 0) std::memcpy(copy.data(), bytes, length);
        utils::utf8ToWideChar(scratch, scratchCapacity, copy.data());
    }
    field->value(scratch);
    return true;
}

bool FS_Table::readValue(Field* field) {
    switch (field->getType()) {
        case FIELD_INT8: {
            unsigned char b;
            if (dataFile->read(&b, 1) != 1) return false;
            static_cast<Int8Field*>(field)->value(b);
            return true;
        }
        case FIELD_INT16:
        case FIELD_INT32:
        case FIELD_INT64: {
            unsigned long long v = 0;
            if (compressed) {
                char buf[codec::kMaxCompressedLength];
                int n = 0;
                // Byte by byte until the continuation bit is clear.
                for (;;) {
                    if (n == codec::kMaxCompressedLength) return false;
                    if (dataFile->read(buf + n, 1) != 1) return false;
                    if ((buf[n++] & 1) == 0) break;
                }
                v = decompressInt(buf);
            } else if (field->getType() == FIELD_INT16) {
                char buf[2];
                if (dataFile->read(buf, 2) != 2) return false;
                v = codec::decodeFixed16(buf);
            } else if (field->getType() == FIELD_INT32) {
                char buf[4];
                if (dataFile->read(buf, 4) != 4) return false;
                v = codec::decodeFixed32(buf);
            } else {
                char buf[8];
                if (dataFile->read(buf, 8) != 8) return false;
                v = codec::decodeFixed64(buf);
            }
            switch (field->getType()) {
                case FIELD_INT16: static_cast<Int16Field*>(field)->value(static_cast<unsigned short>(v)); break;
                case FIELD_INT32: static_cast<Int32Field*>(field)->value(static_cast<unsigned int>(v)); break;
                default: static_cast<Int64Field*>(field)->value(v); break;
            }
            return true;
        }
        case FIELD_TEXT: {
            uint32_t length = 0;
            if (compressed) {
                char buf[codec::kMaxCompressedLength];
                int n = 0;
                for (;;) {
                    if (n == codec::kMaxCompressedLength) return false;
                    if (dataFile->read(buf + n, 1) != 1) return false;
                    if ((buf[n++] & 1) == 0) break;
                }
                unsigned long long v = decompressInt(buf);
                if (v > 0xFFFFull) return false;  // never written by this table
                length = static_cast<uint32_t>(v);
            } else {
                char buf[2];
                if (dataFile->read(buf, 2) != 2) return false;
                length = codec::decodeFixed16(buf);
            }
            PaddedText bytes;
            if (!bytes.make(length)) return false;
            if (length != 0 && dataFile->read(bytes.data(), length) != length) return false;
            return storeText(static_cast<TextField*>(field), bytes.data(), length);
        }
        default:
            return false;  // type 6 is never stored, so it cannot be read back
    }
}

bool FS_Table::read(unsigned int id, Fields& record) {
    if (guard != nullptr && peekedGuardedRead(id, record)) return true;
    return guard != nullptr ? guardedRead(id, record) : readRecord(id, record);
}

bool FS_Table::peekedGuardedRead(unsigned int id, Fields& record) {
    // Only a buffer of the table's own columns: the guard looks its keys up
    // by name in the buffer, and the peek finds them in the schema.
    unsigned int count = schema.count();
    if (record.count() != count || count == 0 || count > kMaxFields) return false;
    for (unsigned int i = 0; i < count; ++i) {
        Field* mine = schema.at(i);
        Field* theirs = record.at(i);
        wchar_t const* a = mine->getName();
        wchar_t const* b = theirs->getName();
        if (mine->getType() != theirs->getType() || a == nullptr || b == nullptr || a[0] != b[0] || wcscmp(a, b) != 0)
            return false;
    }
    if (dataFile == nullptr || pointerFile == nullptr || guard->damaged) return false;
    uint32_t offset;
    if (!readSlot(id, &offset) || offset == kRemovedSlot || !guardSlot(id, offset)) return false;
    uint32_t end;
    if (!peekRecord(offset, schema, &end) || !peekPassesGuard(id, end)) return false;
    // Every check of the guarded read passed on these bytes: store them as
    // readRecord does.
    // Out of memory for a text: the guarded read tries again.
    if (!storePeeked(record, count)) return false;
    // A refused row is left to the guarded read, which notes the damage.
    if (guard->rowCheck != nullptr && guard->rowCheck(guard->rowCheckContext, record) != nullptr) return false;
    return dataFile->seek(static_cast<long>(end), SEEK_FROM_START);
}

bool FS_Table::storePeeked(Fields& record, unsigned int count) {
    unsigned char bitmap[kBitmapBufferSize];
    unsigned int bits = bitmapSize <= kBitmapBufferSize ? bitmapSize : kBitmapBufferSize;
    std::memset(bitmap, 0, sizeof bitmap);
    if (bits != 0) std::memcpy(bitmap, peekBytes.data(), bits);
    for (unsigned int i = 0; i < count; ++i) {
        Field* field = record.at(i);
        field->setNull(checkBit(i, bitmap));
        PeekedColumn const& c = peekColumns[i];
        switch (field->getType()) {
            case FIELD_INT8: static_cast<Int8Field*>(field)->value(static_cast<unsigned char>(c.number)); break;
            case FIELD_INT16: static_cast<Int16Field*>(field)->value(static_cast<unsigned short>(c.number)); break;
            case FIELD_INT32: static_cast<Int32Field*>(field)->value(static_cast<unsigned int>(c.number)); break;
            case FIELD_INT64: static_cast<Int64Field*>(field)->value(c.number); break;
            default:
                if (!storeText(static_cast<TextField*>(field), peekBytes.data() + c.at, c.length)) return false;
                break;
        }
    }
    return true;
}

bool FS_Table::readRecord(unsigned int id, Fields& record) {
    // A closed table answers true and leaves record alone: callers rely on it.
    if (dataFile == nullptr || pointerFile == nullptr) return true;
    uint32_t offset;
    if (!readSlot(id, &offset)) return false;
    // The record's bytes in one read, decoded from memory; only a record
    // that does not decode whole takes the field-by-field way below, which
    // leaves the values read before the failure in the buffer.
    uint32_t end;
    if (record.count() != 0 && record.count() <= kMaxFields && peekRecord(offset, record, &end)) {
        bool ok = storePeeked(record, record.count());
        // Where the field-by-field read would have left the file.
        if (ok) ok = dataFile->seek(static_cast<long>(end), SEEK_FROM_START);
        if (ok) return true;
    }
    // A removed slot (0) reads the data header as a record; callers walk with
    // the move operations, which never stop on one.
    if (!dataFile->seek(static_cast<long>(offset), SEEK_FROM_START)) return false;
    unsigned char bitmap[kBitmapBufferSize];
    std::memset(bitmap, 0, sizeof bitmap);
    unsigned int bits = bitmapSize <= kBitmapBufferSize ? bitmapSize : kBitmapBufferSize;
    if (bits != 0 && dataFile->read(bitmap, bits) != bits) return false;
    if (record.count() == 0) return true;
    for (unsigned int i = 0; i < record.count(); ++i) {
        Field* field = record.at(i);
        // Storing the value clears the flag again, so readers see every field
        // as not null; the order is kept as it is.
        field->setNull(i < kMaxFields && checkBit(i, bitmap));
        if (!readValue(field)) return false;
    }
    return true;
}

// ---- FS_Table: peeking at one text column ---------------------------------------

namespace {

// hash() of the towupper form of an ASCII text, terminator included, as an
// index files the key.
// plain says whether the text is plain ASCII (1..127): only then is the
// answer the bucket.  upper is FS_Table::upperAsciiTable(); words says that
// it upper-cases as keyhash::upperSumWords does, and readable how many bytes
// from text on may be read.
int hashUpperAscii(const unsigned char* text, uint32_t length, uint32_t readable, const uint32_t* upper, bool words,
                   bool* plain) {
    uint32_t acc;
    if (words) {
        acc = keyhash::upperSumWords(text, length, readable, plain);
    } else {
        uint32_t marks = 0;
        acc = keyhash::upperSumTable(text, length, upper, &marks);
        *plain = (marks & kNotPlainAscii) == 0;
    }
    acc = acc * 37u;  // the terminator
    return hash(acc, static_cast<int>(Index::BUCKETS));
}

// Most rows of the cache's tables are shorter than this; a longer one costs
// a second read.
const uint32_t kPeekFirstRead = 96;

// value as a field of integer type keeps it: cut to the field's width.
uint64_t keptByField(unsigned int type, uint64_t value) {
    if (type == FIELD_INT16) return static_cast<unsigned short>(value);
    if (type == FIELD_INT32) return static_cast<unsigned int>(value);
    return value;
}

// hash() of the decimal text of value, as an index files a number.
int hashDecimal(unsigned int value) { return hash(keyhash::decimalKeySum(value), static_cast<int>(Index::BUCKETS)); }

}  // namespace

FS_Table::PeekDecode FS_Table::decodePeeked(const unsigned char* bytes, uint32_t available, bool complete,
                                             Fields& layout, uint32_t* length) {
    unsigned int count = layout.count();
    if (count == 0) return PeekDecode::Broken;
    if (peekColumns.size() < count) peekColumns.resize(count);
    // More bytes than are present: the caller fetches need of them and asks
    // again, or, when the file holds no more, the record is broken.
    auto more = [&](uint64_t need) -> PeekDecode {
        if (complete || need > 0xFFFFFFFFull) return PeekDecode::Broken;
        *length = static_cast<uint32_t>(need);
        return PeekDecode::NeedMore;
    };
    const char* at = reinterpret_cast<const char*>(bytes);
    uint32_t pos = bitmapSize <= kBitmapBufferSize ? bitmapSize : kBitmapBufferSize;
    if (pos > available) return more(pos);
    for (unsigned int i = 0; i < count; ++i) {
        PeekedColumn& c = peekColumns[i];
        unsigned int type = layout.at(i)->getType();
        c.length = 0;
        c.number = 0;
        c.ascii = -1;
        // The variable-length integer at pos, as readValue takes it: it
        // ends inside the bytes present, or where the file ends.
        uint64_t v = 0;
        uint32_t used = 0;
        auto compressedAt = [&]() -> PeekDecode {
            const uint32_t longest = static_cast<uint32_t>(codec::kMaxCompressedLength);
            uint32_t room = available - pos;
            // Most values of the cache's rows take one group.
            if (room != 0 && (bytes[pos] & 1) == 0) {
                v = bytes[pos] >> 1;
                used = 1;
                return PeekDecode::Done;
            }
            int n = codec::decodeCompressed(at + pos, room, &v);
            if (n != 0) {
                used = static_cast<uint32_t>(n);
                return PeekDecode::Done;
            }
            return room >= longest ? PeekDecode::Broken : more(static_cast<uint64_t>(pos) + longest);
        };
        if (type == FIELD_INT8) {
            if (pos + 1ull > available) return more(pos + 1ull);
            c.at = pos;
            c.number = bytes[pos];
            pos += 1;
        } else if (type == FIELD_INT16 || type == FIELD_INT32 || type == FIELD_INT64) {
            if (compressed) {
                PeekDecode r = compressedAt();
                if (r != PeekDecode::Done) return r;
            } else {
                used = type == FIELD_INT16 ? 2 : type == FIELD_INT32 ? 4 : 8;
                if (pos + static_cast<uint64_t>(used) > available) return more(pos + static_cast<uint64_t>(used));
                v = type == FIELD_INT16   ? codec::decodeFixed16(at + pos)
                    : type == FIELD_INT32 ? codec::decodeFixed32(at + pos)
                                          : codec::decodeFixed64(at + pos);
            }
            c.at = pos;
            c.number = keptByField(type, v);
            pos += used;
        } else if (type == FIELD_TEXT) {
            uint32_t textLength = 0;
            if (compressed) {
                PeekDecode r = compressedAt();
                if (r != PeekDecode::Done) return r;
                if (v > 0xFFFFull) return PeekDecode::Broken;
                textLength = static_cast<uint32_t>(v);
            } else {
                used = 2;
                if (pos + 2ull > available) return more(pos + 2ull);
                textLength = codec::decodeFixed16(at + pos);
            }
            pos += used;
            if (pos + static_cast<uint64_t>(textLength) > available) return more(pos + static_cast<uint64_t>(textLength));
            c.at = pos;
            c.length = textLength;
            pos += textLength;
        } else {
            return PeekDecode::Broken;  // type 6 is never stored: read() fails on it
        }
    }
    *length = pos;
    return PeekDecode::Done;
}

bool FS_Table::buildSkim(const bool* decoded, SkimStep* steps, unsigned int* count) {
    unsigned int columns = schema.count();
    if (!compressed || columns == 0 || columns > kMaxFields || peekColumns.size() < columns) return false;
    unsigned int n = 0;
    for (unsigned int i = 0; i < columns; ++i) {
        unsigned int kind = schema.at(i)->getType();
        bool number = kind >= FIELD_INT16 && kind <= FIELD_INT64;
        if (kind != FIELD_INT8 && kind != FIELD_TEXT && !number) return false;
        SkimStep step;
        step.kind = static_cast<unsigned char>(kind);
        step.n = static_cast<unsigned short>(i);
        if (decoded[i]) {
            step.op = kind == FIELD_INT8 ? SKIM_INT8 : kind == FIELD_TEXT ? SKIM_TEXT : SKIM_NUMBER;
        } else if (kind == FIELD_TEXT) {
            step.op = SKIM_PASS_TEXT;
        } else {
            // A run of numbers, or of single bytes, grows by one.
            unsigned char op = kind == FIELD_INT8 ? SKIM_BYTES : SKIM_NUMBERS;
            if (n != 0 && steps[n - 1].op == op) {
                ++steps[n - 1].n;
                continue;
            }
            step.op = op;
            step.n = 1;
        }
        steps[n++] = step;
    }
    *count = n;
    return true;
}

namespace {

// The bytes of the 7-bit group number at p, which has 8 bytes readable,
// found without decoding it: where the first clear low bit is.  0 when the
// number is longer than 8 bytes.
inline uint32_t groupLength8(const unsigned char* p) {
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
    uint64_t word;
    std::memcpy(&word, p, 8);
    uint64_t ends = ~word & 0x0101010101010101ull;
    return ends == 0 ? 0 : static_cast<uint32_t>(__builtin_ctzll(ends)) / 8 + 1;
#else
    for (uint32_t i = 0; i < 8; ++i)
        if ((p[i] & 1) == 0) return i + 1;
    return 0;
#endif
}

// The bytes of the count group numbers at p, which has 8 bytes readable,
// when all of them end in those 8 bytes; 0 otherwise (and for count 0).
inline uint32_t groupsLength8(const unsigned char* p, uint32_t count) {
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
    if (count == 0 || count > 8) return 0;
    uint64_t word;
    std::memcpy(&word, p, 8);
    uint64_t ends = ~word & 0x0101010101010101ull;
    // The last bytes of the numbers before the last one dropped.
    for (uint32_t k = 1; k < count; ++k) ends &= ends - 1;
    return ends == 0 ? 0 : static_cast<uint32_t>(__builtin_ctzll(ends)) / 8 + 1;
#else
    (void)p;
    (void)count;
    return 0;
#endif
}

// The value of the group number of used bytes (1..8) at p, which has 8
// bytes readable, as codec::decodeCompressed sums it: the first byte the
// highest group, each byte's upper seven bits a group.  Gathered from one
// word rather than byte by byte, since used changes from row to row and a
// loop on it is a guess the processor often gets wrong.
inline uint64_t groupValue(const unsigned char* p, uint32_t used) {
#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
    uint64_t word;
    std::memcpy(&word, p, 8);
    // The used bytes, the first the highest, in the low bytes of x.
    uint64_t x = __builtin_bswap64(word) >> (8 * (8 - used));
    x = (x >> 1) & 0x7F7F7F7F7F7F7F7Full;
    // Groups of 7 bits packed to 14 in 16-bit lanes, 28 in 32, 56 in all.
    x = (x & 0x007F007F007F007Full) | ((x & 0x7F007F007F007F00ull) >> 1);
    x = (x & 0x00003FFF00003FFFull) | ((x & 0x3FFF00003FFF0000ull) >> 2);
    x = (x & 0x000000000FFFFFFFull) | ((x & 0x0FFFFFFF00000000ull) >> 4);
    return x;
#else
    uint64_t v = 0;
    for (uint32_t k = 0; k < used; ++k) v = (v << 7) | (p[k] >> 1);
    return v;
#endif
}

}  // namespace

bool FS_Table::skimRow(const unsigned char* bytes, uint32_t available, const SkimStep* steps, unsigned int count,
                       uint32_t* length) {
    uint32_t start = bitmapSize <= kBitmapBufferSize ? bitmapSize : kBitmapBufferSize;
    if (start > available) return false;
    const unsigned char* p = bytes + start;
    const unsigned char* end = bytes + available;
    PeekedColumn* columns = peekColumns.data();
    for (unsigned int s = 0; s < count; ++s) {
        const SkimStep& step = steps[s];
        size_t left = static_cast<size_t>(end - p);
        switch (step.op) {
            case SKIM_NUMBERS: {
                // Each number's eight bytes are readable.
                if (left < 8u * step.n) return false;
                // Most runs fit one word: the run ends at the step.n-th last
                // byte in it.  Found so, the run costs one load; number by
                // number, each load waits for the length of the one before.
                uint32_t used = groupsLength8(p, step.n);
                if (used != 0) {
                    p += used;
                    break;
                }
                for (unsigned int k = 0; k < step.n; ++k) {
                    used = groupLength8(p);
                    if (used == 0) return false;
                    p += used;
                }
                break;
            }
            case SKIM_BYTES:
                if (left < step.n) return false;
                p += step.n;
                break;
            case SKIM_INT8: {
                if (left < 1) return false;
                PeekedColumn& c = columns[step.n];
                c.at = static_cast<uint32_t>(p - bytes);
                c.length = 0;
                c.number = *p;
                c.ascii = -1;
                p += 1;
                break;
            }
            case SKIM_NUMBER: {
                if (left < 8) return false;
                uint32_t used = groupLength8(p);
                if (used == 0) return false;
                PeekedColumn& c = columns[step.n];
                c.at = static_cast<uint32_t>(p - bytes);
                c.length = 0;
                c.number = keptByField(step.kind, groupValue(p, used));
                c.ascii = -1;
                p += used;
                break;
            }
            default: {  // SKIM_TEXT, SKIM_PASS_TEXT
                if (left < 8) return false;
                uint32_t used = groupLength8(p);
                if (used == 0) return false;
                // Most lengths take one byte.
                uint64_t v = used == 1 ? static_cast<uint64_t>(*p >> 1) : groupValue(p, used);
                if (v > 0xFFFFull) return false;
                p += used;
                if (static_cast<size_t>(end - p) < v) return false;
                if (step.op == SKIM_TEXT) {
                    PeekedColumn& c = columns[step.n];
                    c.at = static_cast<uint32_t>(p - bytes);
                    c.length = static_cast<uint32_t>(v);
                    c.number = 0;
                    c.ascii = -1;
                }
                p += static_cast<uint32_t>(v);
                break;
            }
        }
    }
    *length = static_cast<uint32_t>(p - bytes);
    return true;
}

bool FS_Table::peekRecord(uint32_t offset, Fields& layout, uint32_t* end) {
    if (layout.count() == 0 || !dataFile->seek(static_cast<long>(offset), SEEK_FROM_START)) return false;
    if (peekBytes.size() < kPeekFirstRead) peekBytes.resize(kPeekFirstRead);
    uint32_t have = dataFile->read(peekBytes.data(), kPeekFirstRead);
    bool complete = false;
    for (;;) {
        uint32_t n = 0;
        PeekDecode r = decodePeeked(peekBytes.data(), have, complete, layout, &n);
        if (r == PeekDecode::Done) {
            *end = offset + n;
            return true;
        }
        if (r == PeekDecode::Broken) return false;
        // Reads go on where the last one stopped.
        if (n > peekBytes.size()) peekBytes.resize(n > 2 * peekBytes.size() ? n : 2 * peekBytes.size());
        have += dataFile->read(peekBytes.data() + have, static_cast<unsigned int>(peekBytes.size() - have));
        // The file ends before: decide on the bytes it has.
        if (n > have) complete = true;
    }
}

int FS_Table::peekGuardColumn(size_t k) {
    TableGuard::IndexBuckets& entry = guard->indexes[k];
    // The first column of that name, as Fields::name finds it; the answer is
    // kept per index entry, whose field never changes.
    if (peekGuardColumns.size() != guard->indexes.size()) peekGuardColumns.assign(guard->indexes.size(), {nullptr, -1});
    if (peekGuardColumns[k].first != entry.index) {
        int found = -1;
        for (unsigned int i = 0; i < schema.count() && found < 0; ++i) {
            wchar_t const* n = schema.at(i)->getName();
            if (n != nullptr && entry.field == n) found = static_cast<int>(i);
        }
        peekGuardColumns[k] = {entry.index, found};
    }
    return peekGuardColumns[k].second;
}

inline bool FS_Table::peekedBucketOf(PeekedColumn& c, bool text, const unsigned char* bytes, uint32_t readable,
                                     const uint32_t* upper, int* bucket) {
    if (text) {
        if (c.ascii == 0) return false;
        bool plain = false;
        *bucket = hashUpperAscii(bytes + c.at, c.length, readable - c.at, upper, upperAsciiWords, &plain);
        c.ascii = plain ? 1 : 0;
        return plain;
    }
    // Keyed by the low 32 bits, as the index writes it.
    uint32_t key = static_cast<uint32_t>(c.number);
    if (lastDecimalBucket < 0 || key != lastDecimal) {
        lastDecimal = key;
        lastDecimalBucket = hashDecimal(key);
    }
    *bucket = lastDecimalBucket;
    return true;
}

bool FS_Table::peekedBucket(unsigned int column, const unsigned char* bytes, uint32_t readable, int* bucket) {
    unsigned int type = schema.at(column)->getType();
    if (type != FIELD_TEXT && (type < FIELD_INT8 || type > FIELD_INT64)) return false;
    return peekedBucketOf(peekColumns[column], type == FIELD_TEXT, bytes, readable, upperAsciiTable(), bucket);
}

bool FS_Table::peekPassesGuard(unsigned int id, uint32_t end) {
    if (guard == nullptr) return true;
    uint32_t nextOffset = kRemovedSlot;
    if (id != 0xFFFFFFFFu && readSlot(id + 1, &nextOffset) && nextOffset != kRemovedSlot && nextOffset != end)
        return false;
    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (!isCurrent(entry.index)) continue;
        int column = peekGuardColumn(static_cast<size_t>(&entry - guard->indexes.data()));
        if (column < 0) continue;
        int bucket = -1;
        uint32_t readable = static_cast<uint32_t>(peekBytes.size());
        if (!peekedBucket(static_cast<unsigned int>(column), peekBytes.data(), readable, &bucket)) return false;
        // A key that is not where its record is filed is damage whichever
        // read meets it; the guarded read that follows finds it noted.
        if (bucket >= 0 && !guardFiled(entry, id, static_cast<uint32_t>(bucket))) return false;
    }
    return true;
}

bool FS_Table::peekedAscii(PeekedColumn& c, const unsigned char* bytes) {
    if (c.ascii < 0) c.ascii = isPlainAscii(bytes + c.at, c.length) ? 1 : 0;
    return c.ascii == 1;
}

bool FS_Table::peekText(unsigned int id, unsigned int column, const unsigned char** text, uint32_t* length,
                        bool* ascii) {
    if (dataFile == nullptr || pointerFile == nullptr || text == nullptr || length == nullptr) return false;
    if (column >= schema.count() || schema.at(column)->getType() != FIELD_TEXT) return false;
    // A row check needs the decoded record: such a table is read whole.
    if (guard != nullptr && (guard->damaged || guard->rowCheck != nullptr)) return false;
    uint32_t offset;
    if (!readSlot(id, &offset) || offset == kRemovedSlot) return false;
    if (guard != nullptr && !guardSlot(id, offset)) return false;
    uint32_t end;
    if (!peekRecord(offset, schema, &end) || !peekPassesGuard(id, end)) return false;
    *text = peekBytes.data() + peekColumns[column].at;
    *length = peekColumns[column].length;
    if (ascii != nullptr) *ascii = peekedAscii(peekColumns[column], peekBytes.data());
    return true;
}

namespace {

// skipRejected looks at slots and records in blocks of the mapping (each
// counted as read for the mapping's resident pages) that start small, since
// a filter that lets many rows through stops it after a few, and double
// while it goes on.
const uint32_t kSkipFirstSlots = 32;
const uint32_t kSkipMostSlots = 1024;
const uint32_t kSkipFirstBytes = 1024;
const uint32_t kSkipMostBytes = 0x10000;

}  // namespace

void FS_Table::skipRejected(unsigned int& id, unsigned int column, TextReject reject, void* context,
                            unsigned int* wanted) {
    if (wanted != nullptr) *wanted = kNoRow;
    if (dataFile == nullptr || pointerFile == nullptr || guard == nullptr || reject == nullptr) return;
    // A row check needs the decoded record; a walk that does not stand at id
    // is for moveNext to end.
    if (guard->damaged || guard->rowCheck != nullptr || !guard->walking || guard->walkAt != id) return;
    unsigned int count = schema.count();
    if (count == 0 || count > kMaxFields || column >= count || schema.at(column)->getType() != FIELD_TEXT) return;
    // The key checks of peekPassesGuard, each answered by a whole index:
    // an index not yet checked whole is for the reads to check.
    // The buckets are found as peekedBucket finds them, the column's kind
    // looked up once here instead of at every row.
    const unsigned int kMostKeys = SkimProgram::kMostKeys;
    TableGuard::IndexBuckets* keyEntry[kMostKeys];
    unsigned int keyColumn[kMostKeys];
    bool keyText[kMostKeys];
    unsigned int keys = 0;
    for (size_t k = 0; k < guard->indexes.size(); ++k) {
        TableGuard::IndexBuckets& entry = guard->indexes[k];
        if (!isCurrent(entry.index)) continue;
        int keyAt = peekGuardColumn(k);
        if (keyAt < 0) continue;
        if (!entry.whole || keys == kMostKeys) return;
        unsigned int type = schema.at(static_cast<unsigned int>(keyAt))->getType();
        // peekedBucket answers no other column: every row would stop here.
        if (type != FIELD_TEXT && (type < FIELD_INT8 || type > FIELD_INT64)) return;
        keyEntry[keys] = &entry;
        keyText[keys] = type == FIELD_TEXT;
        keyColumn[keys++] = static_cast<unsigned int>(keyAt);
    }
    const uint32_t* upper = upperAsciiTable();
    // The rows are skimmed where they can be: only the keys and the
    // filtered text are decoded.
    if (peekColumns.size() < count) peekColumns.resize(count);
    // A walk asks again after every row it wants, for the same columns:
    // the program is built once for them.
    SkimProgram& program = lastSkim;
    bool same = program.built && program.column == column && program.keys == keys;
    for (unsigned int k = 0; same && k < keys; ++k) same = program.keyColumn[k] == keyColumn[k];
    if (!same) {
        bool looked[kMaxFields] = {};
        looked[column] = true;
        for (unsigned int k = 0; k < keys; ++k) looked[keyColumn[k]] = true;
        program.column = column;
        program.keys = keys;
        for (unsigned int k = 0; k < keys; ++k) program.keyColumn[k] = keyColumn[k];
        program.count = 0;
        program.steps.resize(count);
        program.skim = buildSkim(looked, program.steps.data(), &program.count);
        program.built = true;
    }
    const SkimStep* steps = program.steps.data();
    const unsigned int stepCount = program.count;
    const bool skim = program.skim;

    // The table's files are mapped and lend their bytes in place.
    LinuxMmFile* mappedSlots = exactlyMapped(pointerFile);
    LinuxMmFile* mappedData = exactlyMapped(dataFile);
    if (mappedSlots == nullptr || mappedData == nullptr) return;
    uint32_t slots[kSkipMostSlots];
    uint32_t wantSlots = kSkipFirstSlots;
    uint32_t base = 0;  // the number of slots[0]
    uint32_t haveSlots = 0;
    bool slotsEnd = false;  // the pointer file ends behind slots[haveSlots - 1]
    // Slots from number first on, as readSlot reads them.
    auto readSlots = [&](uint64_t first) -> bool {
        uint64_t position = first * kSlotSize;
        if (position + static_cast<uint64_t>(wantSlots) * kSlotSize > 0x7FFFFFFFull) return false;
        uint32_t got = 0;
        const char* bytes = mappedSlots->view(static_cast<uint32_t>(position), wantSlots * kSlotSize, &got);
        if (bytes == nullptr) return false;
        got /= kSlotSize;
        for (uint32_t i = 0; i < got; ++i) slots[i] = codec::decodeFixed32(bytes + i * kSlotSize);
        base = static_cast<uint32_t>(first);
        haveSlots = got;
        slotsEnd = got < wantSlots;
        if (wantSlots < kSkipMostSlots) wantSlots *= 2;
        return true;
    };
    if (id == 0xFFFFFFFFu || !readSlots(static_cast<uint64_t>(id) + 1)) return;

    uint32_t wantBytes = kSkipFirstBytes;
    const unsigned char* window = nullptr;
    uint32_t windowStart = 0, windowHave = 0;
    bool windowEnd = false;  // the data file ends behind the window
    uint32_t n = base;
    for (;;) {
        if (n - base >= haveSlots) {
            // The file's end is for moveNext, which checks the walk's count.
            if (slotsEnd || !readSlots(n) || haveSlots == 0) return;
        }
        uint32_t offset = slots[n - base];
        if (offset == kRemovedSlot) {
            ++n;
            continue;
        }
        // guardWalkLive's and guardSlot's checks, on the sizes known so far.
        if (offset < guard->header || offset >= guard->dataSize) return;
        if (guard->walkLive >= 1 && offset <= guard->walkLastOffset) return;
        // The next slot, as peekPassesGuard reads it: unreadable past the
        // end of the pointer file.
        if (n == 0xFFFFFFFFu) return;
        bool nextKnown = n + 1 - base < haveSlots;
        if (!nextKnown && !slotsEnd) {
            if (!readSlots(n)) return;
            continue;
        }
        // The record, from the window or from a new one that starts with it.
        uint32_t length = 0;
        PeekDecode decoded = PeekDecode::NeedMore;
        bool inWindow = offset >= windowStart && offset - windowStart <= windowHave;
        for (int attempt = 0; attempt < 2 && decoded == PeekDecode::NeedMore; ++attempt) {
            if (!inWindow) {
                windowStart = offset;
                window = reinterpret_cast<const unsigned char*>(mappedData->view(offset, wantBytes, &windowHave));
                if (window == nullptr) return;
                windowEnd = windowHave < wantBytes;
                if (wantBytes < kSkipMostBytes) wantBytes *= 2;
            }
            uint32_t at = offset - windowStart;
            decoded = skim && skimRow(window + at, windowHave - at, steps, stepCount, &length)
                          ? PeekDecode::Done
                          : decodePeeked(window + at, windowHave - at, windowEnd, schema, &length);
            if (decoded == PeekDecode::NeedMore) {
                if (length > kSkipMostBytes) return;
                while (wantBytes < length) wantBytes *= 2;
                inWindow = false;
            }
        }
        if (decoded != PeekDecode::Done) return;
        const unsigned char* record = window + (offset - windowStart);
        uint32_t end = offset + length;
        if (nextKnown && slots[n + 1 - base] != kRemovedSlot && slots[n + 1 - base] != end) return;
        for (unsigned int k = 0; k < keys; ++k) {
            if (guard->reachedIndex == keyEntry[k]->index && guard->reachedId == n) return;
            int bucket = -1;
            uint32_t readable = windowHave - (offset - windowStart);
            if (!peekedBucketOf(peekColumns[keyColumn[k]], keyText[k], record, readable, upper, &bucket)) return;
            if (!keyEntry[k]->holds(n, static_cast<uint32_t>(bucket))) return;
        }
        PeekedColumn& text = peekColumns[column];
        if (!peekedAscii(text, record)) return;
        if (!reject(context, record + text.at, text.length)) {
            if (wanted != nullptr) *wanted = n;
            return;
        }
        // Passed over: counted as moveNext counts a live slot.
        ++guard->walkLive;
        guard->walkAt = n;
        guard->walkLastOffset = offset;
        id = n;
        ++n;
    }
}

bool FS_Table::update(unsigned int id, Fields& record) {
    if (dataFile == nullptr || pointerFile == nullptr) return false;
    if (writeFailed()) return false;
    if (compressed) {
        // The new record first: when the disk refuses it, the old one is
        // still there.  The files end as they would the other way round.
        if (!insert(record)) return false;
        remove(id);
        return true;
    }
    Fields stored(record);
    if (!read(id, stored)) return false;
    uint32_t offset;
    if (!readSlot(id, &offset) || !dataFile->seek(static_cast<long>(offset), SEEK_FROM_START)) return false;
    if (record.count() > kMaxFields) return false;
    unsigned char bitmap[kBitmapBufferSize];
    std::memset(bitmap, 0, sizeof bitmap);
    for (unsigned int i = 0; i < record.count(); ++i)
        if (record.at(i)->isNull()) setBit(i, bitmap);
    if (!writeAll(dataFile, std::string(reinterpret_cast<char*>(bitmap), bitmapSize))) return noteWriteFailure(dataPath);
    for (unsigned int i = 0; i < record.count(); ++i) {
        Field* field = record.at(i);
        unsigned int type = field->getType();
        if (type >= FIELD_INT8 && type <= FIELD_INT64) {
            if (!writeValue(field)) return noteWriteFailure(dataPath);
        } else if (type == FIELD_TEXT) {
            wchar_t const* now = static_cast<TextField*>(field)->value();
            wchar_t const* before = (i < stored.count() && stored.at(i)->getType() == FIELD_TEXT)
                                        ? static_cast<TextField*>(stored.at(i))->value()
                                        : nullptr;
            if (wideLength(now) != wideLength(before)) {
                // Fields before this one were overwritten already; harmless,
                // the old record is dead from here on.
                remove(id);
                return insert(record);
            }
            // Same character count: overwritten in place even when the UTF-8
            // length differs.
            if (!writeValue(field)) return noteWriteFailure(dataPath);
        }
    }
    return true;
}

bool FS_Table::remove(unsigned int id) {
    if (dataFile == nullptr || pointerFile == nullptr) return false;
    unsigned long long position = static_cast<unsigned long long>(id) * kSlotSize;
    if (!pointerFile->seek(0, SEEK_FROM_END)) return false;
    // Only existing slots can be zeroed; a number past the end would grow the file.
    if (position + kSlotSize > static_cast<unsigned long long>(pointerFile->tell())) return false;
    if (!pointerFile->seek(static_cast<long>(position), SEEK_FROM_START)) return false;
    std::string zero;
    codec::putFixed32(&zero, kRemovedSlot);
    if (!writeAll(pointerFile, zero)) return false;
    // A walk in progress has counted slots this removal changes.
    if (guard != nullptr) guard->walking = false;
    bool dec = decCount(0);
    bool inc = incCount(1);
    return dec && inc;
}

// ---- FS_Table: walks ----------------------------------------------------------

bool FS_Table::moveFirst(unsigned int& id) {
    if (pointerFile == nullptr) return false;
    uint32_t slot;
    if (!readSlot(0, &slot)) {
        // An empty pointer file: a walk over no slots, and no live one.
        if (guard != nullptr && !guard->damaged) {
            guardWalkStart(kRemovedSlot);
            if (pointerFile->eof()) guardWalkEnd();
        }
        return false;
    }
    // Under the guard a walk from here keeps count of the live slots.
    if (guard != nullptr) guardWalkStart(slot);
    if (slot != kRemovedSlot) {
        id = 0;
        return true;
    }
    unsigned int from = 0;
    if (!moveNext(from)) return false;
    id = from;
    return true;
}

bool FS_Table::moveNext(unsigned int& id) {
    if (pointerFile == nullptr) return false;
    unsigned long long position = (static_cast<unsigned long long>(id) + 1) * kSlotSize;
    if (position > 0x7FFFFFFFull || !pointerFile->seek(static_cast<long>(position), SEEK_FROM_START)) return false;
    unsigned int n = id + 1;
    uint32_t slot;
    // Only a move on from where the walk stands continues it.
    bool walk = guard != nullptr && guard->walking && guard->walkAt == id && !guard->damaged;
    if (guard != nullptr && !walk) guard->walking = false;
    while (readWord(pointerFile, &slot)) {
        if (slot != kRemovedSlot) {
            if (walk && !guardWalkLive(n, slot)) return false;
            id = n;
            return true;
        }
        ++n;
    }
    if (walk && pointerFile->eof()) guardWalkEnd();
    return false;
}

bool FS_Table::movePrevious(unsigned int& id) {
    if (pointerFile == nullptr) return false;
    unsigned int n = id - 1;
    unsigned long long position = static_cast<unsigned long long>(n) * kSlotSize;
    if (position > 0x7FFFFFFFull || !pointerFile->seek(static_cast<long>(position), SEEK_FROM_START)) return false;
    uint32_t slot;
    // Only the first read seeks: over a removed slot the number counts down
    // while the reads go on forward, and the walk ends at the next live slot
    // above or at the end of the file.
    while (readWord(pointerFile, &slot)) {
        if (slot != kRemovedSlot) {
            id = n;
            return true;
        }
        --n;
    }
    return false;
}

bool FS_Table::moveLast(unsigned int& id, unsigned int& index) {
    if (pointerFile == nullptr) return false;
    unsigned int current = 0;
    if (!moveFirst(current)) return false;
    unsigned int live = 1;
    unsigned int last = current;
    while (moveNext(current)) {
        last = current;
        ++live;
    }
    id = last;
    index = live - 1;
    // The result is 0 even though a record was found; callers read id and index.
    return false;
}

bool FS_Table::eof() {
    if (dataFile == nullptr) return false;
    long here = dataFile->tell();
    dataFile->seek(0, SEEK_FROM_END);
    long end = dataFile->tell();
    dataFile->seek(here, SEEK_FROM_START);
    return here == end;
}

// ---- FS_Table: counts ---------------------------------------------------------

bool FS_Table::count(int which, unsigned int* result) {
    if (which != 0 && which != 1) return false;
    if (dataFile == nullptr) return false;
    if (!dataFile->seek(which == 0 ? kStoredCountOffset : kDeletedCountOffset, SEEK_FROM_START)) return false;
    uint32_t value;
    if (!readWord(dataFile, &value)) return false;
    *result = value;
    return true;
}

bool FS_Table::count(int which, int delta) {
    unsigned int value;
    if (!count(which, &value)) return false;
    value += static_cast<unsigned int>(delta);  // wraps without a check
    if (!dataFile->seek(which == 0 ? kStoredCountOffset : kDeletedCountOffset, SEEK_FROM_START)) return false;
    std::string word;
    codec::putFixed32(&word, value);
    return writeAll(dataFile, word);
}

bool FS_Table::incCount(int which) { return count(which, 1); }

bool FS_Table::decCount(int which) { return count(which, -1); }

// ---- FS_Table: lock -----------------------------------------------------------

int FS_Table::lock() { return mutex == nullptr ? SYNC_FAILED : mutex->wait(); }

int FS_Table::lock(long timeout) { return mutex == nullptr ? SYNC_FAILED : mutex->wait(timeout); }

int FS_Table::unlock() { return mutex == nullptr ? 0 : mutex->release(); }

// ---- FS_Table: index list -----------------------------------------------------

bool FS_Table::hashIndexesUpdate(Fields& record, unsigned int id) {
    // An index that could not take the number (a full disk) no longer holds
    // every record: that is a failed write, and lookups through it would miss
    // the record.  The other indexes are still written.
    bool written = true;
    for (Index* index : indexes) {
        if (index->getFieldName() == nullptr) return false;
        Field* field = record.name(index->getFieldName());
        if (field == nullptr) return false;
        if (field->isNull()) continue;
        unsigned int type = field->getType();
        if (type >= FIELD_INT8 && type <= FIELD_INT64) {
            wchar_t key[24];
            // 64-bit values are keyed by their low 32 bits.
            wcs_itoa(static_cast<unsigned int>(integerValue(field)), key);
            if (!index->write(static_cast<unsigned int>(hash(key, Index::BUCKETS)), id))
                written = noteWriteFailure(index->getIndexFullPathName());
        } else if (type == FIELD_TEXT) {
            int bucket = upperTextBucket(static_cast<TextField*>(field)->value());
            if (!index->write(static_cast<unsigned int>(bucket), id))
                written = noteWriteFailure(index->getIndexFullPathName());
        }
    }
    return written;
}

const uint32_t* FS_Table::upperAsciiTable() {
    if (!upperAsciiReady) {
        for (unsigned int b = 0; b < 256; ++b)
            upperAscii[b] = b != 0 && b < 128 ? static_cast<uint32_t>(std::towupper(static_cast<wint_t>(b))) : kNotPlainAscii;
        // Eight bytes at a time where the locale upper-cases ASCII as C does.
        upperAsciiWords = keyhash::kWordsServe;
        for (unsigned int b = 1; b < 128; ++b)
            if (upperAscii[b] != (b >= 'a' && b <= 'z' ? b - 0x20 : b)) upperAsciiWords = false;
        upperAsciiReady = true;
    }
    return upperAscii;
}

int FS_Table::upperTextBucket(wchar_t const* text) {
    const uint32_t* upper = upperAsciiTable();
    uint32_t acc = 0;
    if (text != nullptr) {
        for (; *text != L'\0'; ++text) {
            uint32_t c = static_cast<uint32_t>(*text);
            acc = acc * 37u + (c < 128 ? upper[c] : static_cast<uint32_t>(static_cast<wchar_t>(std::towupper(static_cast<wint_t>(*text)))));
        }
    }
    acc = acc * 37u;  // the terminator
    return hash(acc, static_cast<int>(Index::BUCKETS));
}

bool FS_Table::saveHashIndexList(std::vector<Index*>& list) {
    wchar_t* path = indexListPath();
    AbstractFile* file = SysFactory::createMmFile(path);
    kelm_free(path);
    if (file == nullptr) return false;
    if (file->create()) {
        std::string bytes;
        for (Index* index : list) {
            codec::putFixed32(&bytes, kIndexListTag);
            putWideName(&bytes, index->getIndexName());
            putWideName(&bytes, index->getFieldName());
        }
        writeAll(file, bytes);
        file->close();
    }
    delete file;
    return true;
}

bool FS_Table::retrieveHashIndexList(std::vector<Index*>& list) {
    list.clear();
    wchar_t* path = indexListPath();
    AbstractFile* file = SysFactory::createMmFile(path);
    kelm_free(path);
    if (file == nullptr) return false;
    if (file->open()) {
        uint32_t tag, bytes;
        while (readWord(file, &tag) && readWord(file, &bytes)) {
            wchar_t* indexName = readWideName(file, bytes);
            if (indexName == nullptr) break;
            uint32_t fieldBytes;
            wchar_t* fieldName = readWord(file, &fieldBytes) ? readWideName(file, fieldBytes) : nullptr;
            if (fieldName == nullptr) {
                kelm_free(indexName);
                break;
            }
            if (tag == kIndexListTag) {
                Index* index = new Index(indexName, directory, fieldName);
                if (index->open()) list.push_back(index);
                else delete index;
            }
            kelm_free(indexName);
            kelm_free(fieldName);
        }
        file->close();
    }
    delete file;
    return true;
}

bool FS_Table::eraseHashIndexList(std::vector<Index*>&) {
    wchar_t* path = indexListPath();
    if (path == nullptr) return false;
    unlinkWide(path);
    kelm_free(path);
    return true;
}

void FS_Table::freeHashIndexList(std::vector<Index*>& list) {
    for (Index* index : list) delete index;
    list.clear();
}

Index* FS_Table::searchHashIndexForIndexName(wchar_t const* indexName, bool removeFromList) {
    return findIndex(indexes, [](Index const* index) { return index->getIndexName(); }, indexName,
                     removeFromList);
}

Index* FS_Table::searchHashIndexForFieldName(wchar_t const* fieldName, bool removeFromList) {
    return findIndex(indexes, [](Index const* index) { return index->getFieldName(); }, fieldName,
                     removeFromList);
}

// ---- FS_Table: index building and lookup -------------------------------------

bool FS_Table::addHashIndex(wchar_t const* indexName, wchar_t const* fieldName) {
    if (indexName == nullptr || fieldName == nullptr) return false;
    if (searchHashIndexForIndexName(indexName, false) != nullptr) return false;
    if (!buildHashIndex(indexName, fieldName)) return false;
    saveHashIndexList(indexes);
    return true;
}

bool FS_Table::removeHashIndex(wchar_t const* indexName) {
    Index* index = searchHashIndexForIndexName(indexName, true);
    if (index != nullptr) {
        index->close();
        index->erase();
        delete index;
        saveHashIndexList(indexes);
    }
    // The result is false in every case, also after a removal.
    return false;
}

bool FS_Table::buildHashIndex(wchar_t const* indexName, wchar_t const* fieldName) {
    if (indexName == nullptr || fieldName == nullptr) return false;
    if (schema.name(fieldName) == nullptr) return false;
    Index* index = new Index(indexName, directory, fieldName);
    if (!index->create()) {
        delete index;
        return false;
    }
    // A walk without criteria over every live record; the key is written
    // whatever the field's null flag says, and a failed read still leaves
    // the values read so far in the buffer.
    Fields buffer(schema);
    Field* field = buffer.name(fieldName);
    unsigned int id = 0;
    bool more = moveFirst(id);
    while (more) {
        read(id, buffer);
        unsigned int type = field->getType();
        if (type >= FIELD_INT8 && type <= FIELD_INT64) {
            wchar_t key[24];
            wcs_itoa(static_cast<unsigned int>(integerValue(field)), key);
            index->write(static_cast<unsigned int>(hash(key, Index::BUCKETS)), id);
        } else if (type == FIELD_TEXT) {
            wchar_t const* text = static_cast<TextField*>(field)->value();
            size_t n = wideLength(text);
            wchar_t* upper = static_cast<wchar_t*>(kelm_malloc((n + 1) * sizeof(wchar_t)));
            if (upper != nullptr) {
                if (text != nullptr) std::memcpy(upper, text, (n + 1) * sizeof(wchar_t));
                else upper[0] = 0;
                wcsupper(upper);
                index->write(static_cast<unsigned int>(hash(upper, Index::BUCKETS)), id);
                kelm_free(upper);
            }
        } else if (type == FIELD_HEX) {
            // The bucket is the first data byte itself, not a hash.
            unsigned char const* v = static_cast<HexField*>(field)->value();
            unsigned int bucket = (v != nullptr && v[0] > 0) ? v[1] : 0;
            index->write(bucket, id);
        }
        more = moveNext(id);
    }
    indexes.push_back(index);
    return true;
}

bool FS_Table::hashIndex_moveFirst(Index& index, wchar_t const* key, unsigned int& id, unsigned int& next) {
    if (pointerFile == nullptr || key == nullptr) return false;
    unsigned int bucket = static_cast<unsigned int>(hash(key, Index::BUCKETS));
    unsigned int headId, headNext;
    if (!index.read(bucket, &headId, &headNext)) return false;
    // Under the guard every chain slot is checked before the lookup relies
    // on it; damage ends the lookup and stays noted for the caller.
    if (guard != nullptr && !guardChainSlot(index, bucket, headId, headNext)) return false;
    if (headId == Index::EMPTY) return false;
    uint32_t slot;
    if (!readSlot(headId, &slot)) return false;
    next = headNext;
    if (guard != nullptr) guardChainAt(index, headNext, bucket);
    if (slot == kRemovedSlot) return hashIndex_moveNext(index, id, next);
    id = headId;
    if (guard != nullptr) guardReached(&index, id, bucket);
    return true;
}

bool FS_Table::hashIndex_moveNext(Index& index, unsigned int& id, unsigned int& next) {
    if (pointerFile == nullptr) return false;
    // The bucket this chain hangs from, when the guard kept it.
    uint32_t bucket = 0;
    bool knownBucket = guard != nullptr && next != Index::EMPTY && guardChainBucket(index, next, &bucket);
    // Index::write appends every overflow slot at the end of the file and
    // links it to slots that were there before, so along a sound chain the
    // overflow slot numbers fall strictly and never reach the buckets.  A
    // link that does not fall is damage (a loop would spin here, or in the
    // cursor that calls again): the chain ends at it, next becomes the end
    // mark, and sound chains walk exactly as before.
    while (next != Index::EMPTY) {
        if (next < Index::BUCKETS) {
            next = Index::EMPTY;
            return false;
        }
        unsigned int candidate, after;
        if (!index.read(next, &candidate, &after)) {
            // An unreadable slot ends the chain here rather than spinning on it.
            next = Index::EMPTY;
            return false;
        }
        if (guard != nullptr && !guardChainSlot(index, next, candidate, after)) {
            next = Index::EMPTY;
            return false;
        }
        if (after != Index::EMPTY && after >= next) after = Index::EMPTY;
        next = after;
        uint32_t slot;
        if (!readSlot(candidate, &slot)) return false;
        if (slot != kRemovedSlot) {
            id = candidate;
            if (guard != nullptr) {
                if (knownBucket) guardChainAt(index, next, bucket);
                guardReached(knownBucket ? &index : nullptr, id, bucket);
            }
            return true;
        }
    }
    return false;
}
