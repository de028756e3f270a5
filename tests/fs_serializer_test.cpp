// The serialiser on a file and the byte layout of a result record.
#include "fscanner/fs/fs_serializer.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <new>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fscommon/sysfactory.h"
#include "fscanner/fscommon/sysfile.h"
#include "support/testsupport.h"

// ---- array allocations, observed --------------------------------------------
// The serialiser loads long strings through a new[] block and short ones
// through its inline buffer; the sizes of array allocations show which.

namespace {
bool g_recordArrays = false;
std::vector<size_t>* g_arraySizes = nullptr;

void* allocateArray(size_t size) {
    if (g_recordArrays && g_arraySizes != nullptr) {
        g_recordArrays = false;  // the vector itself may allocate
        g_arraySizes->push_back(size);
        g_recordArrays = true;
    }
    return std::malloc(size == 0 ? 1 : size);
}
}  // namespace

void* operator new[](size_t size) {
    void* p = allocateArray(size);
    if (p == nullptr) throw std::bad_alloc();
    return p;
}
void* operator new[](size_t size, const std::nothrow_t&) noexcept {
    return allocateArray(size);
}
void operator delete[](void* p) noexcept {
    std::free(p);
}
void operator delete[](void* p, size_t) noexcept {
    std::free(p);
}
void operator delete[](void* p, const std::nothrow_t&) noexcept {
    std::free(p);
}

namespace {

class ArrayAllocations {
public:
    ArrayAllocations() {
        g_arraySizes = &sizes;
        g_recordArrays = true;
    }
    ~ArrayAllocations() { stop(); }
    void stop() {
        g_recordArrays = false;
        g_arraySizes = nullptr;
    }
    bool contains(size_t size) const {
        for (size_t s : sizes)
            if (s == size) return true;
        return false;
    }
    size_t largest() const {
        size_t m = 0;
        for (size_t s : sizes) m = s > m ? s : m;
        return m;
    }
    std::vector<size_t> sizes;
};

// ---- an in-memory file ------------------------------------------------------
// Positional file over a byte string, with the end-flag rules of the mapped
// file, a limit on the bytes a write may take, and a count of close() calls.

class MemoryFile : public AbstractFile {
public:
    explicit MemoryFile(const std::string& content = std::string()) : bytes(content) {}
    bool create() override {
        bytes.clear();
        position = 0;
        return true;
    }
    bool open() override {
        position = 0;
        return true;
    }
    bool close() override {
        ++closes;
        return true;
    }
    unsigned int read(void* buffer, unsigned int length) override {
        size_t left = bytes.size() - position;
        size_t n = length > left ? left : length;
        std::memcpy(buffer, bytes.data() + position, n);
        position += n;
        endFlag = n < length;
        return static_cast<unsigned int>(n);
    }
    unsigned int write(void* buffer, unsigned int length) override {
        size_t n = length > writeLimit ? writeLimit : length;
        writeLimit -= n;
        if (position + n > bytes.size()) bytes.resize(position + n);
        std::memcpy(&bytes[position], buffer, n);
        position += n;
        return static_cast<unsigned int>(n);
    }
    bool seek(long offset, int origin) override {
        endFlag = false;
        long base = origin == 1 ? 0 : origin == 2 ? static_cast<long>(position)
                                  : origin == 3 ? static_cast<long>(bytes.size()) : -1;
        if (base < 0) return false;
        long target = base + offset;
        if (target < 0 || target > static_cast<long>(bytes.size())) return false;
        position = static_cast<size_t>(target);
        return true;
    }
    long tell() override { return static_cast<long>(position); }
    bool eof() override { return endFlag; }
    bool size(unsigned int* result) override {
        *result = static_cast<unsigned int>(bytes.size());
        return true;
    }

    std::string bytes;
    size_t position = 0;
    bool endFlag = false;
    size_t writeLimit = static_cast<size_t>(-1);
    int closes = 0;
};

std::string hex(const std::string& bytes) {
    static const char digits[] = "0123456789ABCDEF";
    std::string out;
    for (size_t i = 0; i < bytes.size(); ++i) {
        if (i != 0) out += ' ';
        unsigned char c = static_cast<unsigned char>(bytes[i]);
        out += digits[c >> 4];
        out += digits[c & 15];
    }
    return out;
}

std::string unhex(const std::string& text) {
    std::string out;
    for (size_t i = 0; i < text.size();) {
        if (text[i] == ' ') {
            ++i;
            continue;
        }
        out += static_cast<char>(std::stoi(text.substr(i, 2), nullptr, 16));
        i += 2;
    }
    return out;
}

// ---- encoding of single items -----------------------------------------------

TEST(FsSerializatorOnFile, EmptyStringTakesExactlyFourBytesAndComesBackEmptyNotNull) {
    MemoryFile file;
    FsSerializator_OnFile out(&file, false);
    EXPECT_TRUE(out.saveString(L""));
    EXPECT_EQ("00 00 00 01", hex(file.bytes));

    file.seek(0, 1);
    FsSerializator_OnFile in(&file, false);
    wchar_t* text = in.loadString();
    ASSERT_NE(nullptr, text);
    EXPECT_STREQ(L"", text);
    EXPECT_EQ(0, in.getLastError());
    delete[] text;
}

TEST(FsSerializatorOnFile, Unsigned32IsStoredMostSignificantFirst) {
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_TRUE(s.saveUnsigned32(0x01020304u));
    EXPECT_EQ("01 02 03 04", hex(file.bytes));
    file.seek(0, 1);
    EXPECT_EQ(0x01020304u, s.loadUnsigned32());
}

TEST(FsSerializatorOnFile, SignedIntegerUsesTheBytesOfItsUnsignedForm) {
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_TRUE(s.saveInteger32(-2));
    EXPECT_EQ("FF FF FF FE", hex(file.bytes));
    file.seek(0, 1);
    EXPECT_EQ(-2, s.loadInteger32());
}

TEST(FsSerializatorOnFile, Unsigned64IsStoredMostSignificantFirst) {
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_TRUE(s.saveUnsigned64(0x0102030405060708ull));
    EXPECT_EQ("01 02 03 04 05 06 07 08", hex(file.bytes));
    file.seek(0, 1);
    EXPECT_EQ(0x0102030405060708ull, s.loadUnsigned64());
}

TEST(FsSerializatorOnFile, StringCountIsUtf8ByteLengthPlusOneWithNoTerminatorStored) {
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_TRUE(s.saveString(L"a\u00e9\u20ac\U0001F600"));
    EXPECT_EQ("00 00 00 0B 61 C3 A9 E2 82 AC F0 9F 98 80", hex(file.bytes));
    file.seek(0, 1);
    wchar_t* text = s.loadString();
    ASSERT_NE(nullptr, text);
    EXPECT_STREQ(L"a\u00e9\u20ac\U0001F600", text);
    delete[] text;
}

TEST(FsSerializatorOnFile, StringOf127BytesLoadsThroughANewBlock) {
    std::wstring text(127, L'x');
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    ASSERT_TRUE(s.saveString(text.c_str()));
    EXPECT_EQ("00 00 00 80", hex(file.bytes.substr(0, 4)));
    file.seek(0, 1);
    ArrayAllocations allocations;
    wchar_t* loaded = s.loadString();
    allocations.stop();
    ASSERT_NE(nullptr, loaded);
    EXPECT_EQ(text, std::wstring(loaded));
    // A block of the count (128 bytes) for the UTF-8 text, then 4 bytes per
    // counted character for the result.
    EXPECT_TRUE(allocations.contains(128));
    EXPECT_TRUE(allocations.contains(128 * sizeof(wchar_t)));
    delete[] loaded;
}

TEST(FsSerializatorOnFile, StringOf126BytesLoadsThroughTheInlineBuffer) {
    std::wstring text(126, L'y');
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    ASSERT_TRUE(s.saveString(text.c_str()));
    EXPECT_EQ("00 00 00 7F", hex(file.bytes.substr(0, 4)));
    file.seek(0, 1);
    ArrayAllocations allocations;
    wchar_t* loaded = s.loadString();
    allocations.stop();
    ASSERT_NE(nullptr, loaded);
    EXPECT_EQ(text, std::wstring(loaded));
    // Only the result: 127 characters of 4 bytes.
    ASSERT_EQ(1u, allocations.sizes.size());
    EXPECT_EQ(127 * sizeof(wchar_t), allocations.sizes[0]);
    delete[] loaded;
}

TEST(FsSerializatorOnFile, CountOfZeroLoadsANullStringWithoutError) {
    MemoryFile file(unhex("00 00 00 00 00 00 00 01"));
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(nullptr, s.loadString());
    EXPECT_EQ(0, s.getLastError());
    wchar_t* next = s.loadString();
    ASSERT_NE(nullptr, next);
    EXPECT_STREQ(L"", next);
    delete[] next;
}

TEST(FsSerializatorOnFile, NullFileStartsWithTheErrorAndDoesNothing) {
    FsSerializator_OnFile s(nullptr, true);
    EXPECT_EQ(-1, s.getLastError());
    EXPECT_FALSE(s.saveUnsigned32(1));
    EXPECT_FALSE(s.saveString(L"x"));
    EXPECT_EQ(0u, s.loadUnsigned32());
    EXPECT_EQ(nullptr, s.loadString());
}

TEST(FsSerializatorOnFile, NullStringIsRefusedAndLatchesTheError) {
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_FALSE(s.saveString(nullptr));
    EXPECT_EQ(-1, s.getLastError());
    EXPECT_FALSE(s.saveUnsigned32(5));
    EXPECT_EQ("", hex(file.bytes));
}

TEST(FsSerializatorOnFile, ShortWriteStoresMinusOneAndLaterSavesDoNothing) {
    MemoryFile file;
    file.writeLimit = 6;
    FsSerializator_OnFile s(&file, false);
    EXPECT_TRUE(s.saveUnsigned32(1));
    EXPECT_FALSE(s.saveUnsigned32(2));  // only 2 of its 4 bytes went out
    EXPECT_EQ(-1, s.getLastError());
    file.writeLimit = 100;
    EXPECT_FALSE(s.saveUnsigned64(3));
    EXPECT_FALSE(s.saveString(L"abc"));
    EXPECT_EQ(6u, file.bytes.size());
}

TEST(FsSerializatorOnFile, ShortWriteOfStringBytesStoresMinusOne) {
    MemoryFile file;
    file.writeLimit = 5;  // the count and one of three bytes
    FsSerializator_OnFile s(&file, false);
    EXPECT_FALSE(s.saveString(L"abc"));
    EXPECT_EQ(-1, s.getLastError());
}

TEST(FsSerializatorOnFile, ShortReadStoresMinusOneGivesZeroAndLatchesUntilReset) {
    MemoryFile file(unhex("00 00 00 07 00 00"));
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(7u, s.loadUnsigned32());
    EXPECT_EQ(0u, s.loadUnsigned32());
    EXPECT_EQ(-1, s.getLastError());
    file.seek(0, 1);
    EXPECT_EQ(0u, s.loadUnsigned32());  // the error stands, nothing is read
    EXPECT_EQ(0, file.tell());
    s.reset();
    EXPECT_EQ(0, s.getLastError());
    EXPECT_EQ(7u, s.loadUnsigned32());
}

TEST(FsSerializatorOnFile, TruncatedStringGivesNullAndMinusOne) {
    MemoryFile file(unhex("00 00 00 0A 61 62 63"));
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(nullptr, s.loadString());
    EXPECT_EQ(-1, s.getLastError());
}

TEST(FsSerializatorOnFile, TruncatedLongStringFreesItsBlock) {
    // 200 promised, 150 present: the block is made and dropped again.
    std::string bytes = unhex("00 00 00 C9") + std::string(150, 'q');
    MemoryFile file(bytes);
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(nullptr, s.loadString());
    EXPECT_EQ(-1, s.getLastError());
}

TEST(FsSerializatorOnFile, AbsurdCountStopsCleanlyWithoutAHugeAllocation) {
    MemoryFile file(unhex("FF FF FF FF 61 62 63"));
    FsSerializator_OnFile s(&file, false);
    ArrayAllocations allocations;
    wchar_t* text = s.loadString();
    allocations.stop();
    EXPECT_EQ(nullptr, text);
    EXPECT_EQ(-1, s.getLastError());
    EXPECT_LT(allocations.largest(), 4096u);
}

TEST(FsSerializatorOnFile, DestructorClosesTheFileOnlyWhenAskedAndNeverDeletesIt) {
    MemoryFile file;
    { FsSerializator_OnFile s(&file, false); }
    EXPECT_EQ(0, file.closes);
    { FsSerializator_OnFile s(&file, true); }
    EXPECT_EQ(1, file.closes);
    EXPECT_TRUE(file.seek(0, 1));  // still a usable object
}

TEST(FsSerializatorOnFile, WorksOnAMappedFile) {
    testsupport::TempDir dir;
    std::string path = dir.file("mapped");
    std::wstring name(path.begin(), path.end());
    AbstractFile* file = SysFactory::createMmFile(name.c_str());
    ASSERT_TRUE(file->create());
    {
        FsSerializator_OnFile s(file, true);
        EXPECT_TRUE(s.saveString(L"hi"));
        EXPECT_TRUE(s.saveUnsigned32(9));
    }
    EXPECT_EQ("00 00 00 03 68 69 00 00 00 09", hex(testsupport::readFile(path)));
    ASSERT_TRUE(file->open());
    {
        FsSerializator_OnFile s(file, true);
        wchar_t* text = s.loadString();
        ASSERT_NE(nullptr, text);
        EXPECT_STREQ(L"hi", text);
        delete[] text;
        EXPECT_EQ(9u, s.loadUnsigned32());
        EXPECT_EQ(0u, s.loadUnsigned32());  // the end shows as a read error
        EXPECT_EQ(-1, s.getLastError());
    }
    delete file;
}

// ---- record layout ----------------------------------------------------------

const char* const kFullRecord =
    "00 00 00 03 2F 64 "                // path "/d"
    "00 00 00 02 66 "                   // name "f"
    "00 00 00 03 61 62 "                // md5 "ab"
    "00 00 00 01 "                      // sha256 ""
    "00 00 0F FF "                      // presence mask: every bit
    "11 22 33 44 "                      // attr
    "01 02 03 04 05 06 07 08 "          // size
    "0A 0B 0C 0D "                      // device
    "00 00 00 64 "                      // group id 100
    "00 00 03 E8 "                      // user id 1000
    "00 01 23 45 "                      // inode
    "5F 5E 10 00 "                      // last access time
    "FF FF FF FF "                      // create time -1
    "00 00 00 01 "                      // last modify time
    "00 00 00 02 "                      // link count
    "DE AD BE EF "                      // CRC32
    "CA FE BA BE";                      // Q32

TEST(FsFileInfoRecord, EveryPresenceBitGivesEveryFieldInOrder) {
    MemoryFile file(unhex(kFullRecord));
    FsSerializator_OnFile s(&file, false);
    FsFileInfo info;
    ASSERT_EQ(0, info.loadObject(s));
    EXPECT_STREQ(L"/d", info.getPath());
    EXPECT_STREQ(L"f", info.getName());
    EXPECT_STREQ(L"ab", info.getMD5());
    EXPECT_STREQ(L"", info.getSHA256());
    EXPECT_EQ(0xFFFu, info.getValidMask());
    EXPECT_EQ(0x11223344u, info.getAttr());
    EXPECT_EQ(0x0102030405060708ull, info.getSize());
    EXPECT_EQ(0x0A0B0C0Du, info.getDevice());
    EXPECT_EQ(100u, info.getGroupId());
    EXPECT_EQ(1000u, info.getUserId());
    EXPECT_EQ(0x12345u, info.getINode());
    EXPECT_EQ(0x5F5E1000L, info.getLastAccessTime());
    EXPECT_EQ(-1L, info.getCreateTime());
    EXPECT_EQ(1L, info.getLastModifyTime());
    EXPECT_EQ(2u, info.getLinkCount());
    EXPECT_EQ(0xDEADBEEFu, info.getCRC32());
    EXPECT_EQ(0xCAFEBABEu, info.getQ32());
    EXPECT_FALSE(info.getStatFailed());
    EXPECT_EQ(file.bytes.size(), static_cast<size_t>(file.tell()));

    MemoryFile again;
    FsSerializator_OnFile out(&again, false);
    EXPECT_EQ(0, info.saveObject(out));
    EXPECT_EQ(kFullRecord, hex(again.bytes));
}

TEST(FsFileInfoRecord, NoPresenceBitGivesTheFourStringsAndTheMaskOnly) {
    FsFileInfo info;
    info.setFilePath(L"/tmp");
    info.setFileName(L"x");
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(0, info.saveObject(s));
    EXPECT_EQ("00 00 00 05 2F 74 6D 70 "
              "00 00 00 02 78 "
              "00 00 00 02 30 "
              "00 00 00 02 30 "
              "00 00 00 00",
              hex(file.bytes));
}

TEST(FsFileInfoRecord, SettersGiveTheirBitsAndSaveInRisingBitOrder) {
    FsFileInfo info;
    info.setFilePath(L"p");
    info.setFileName(L"n");
    info.setQ32(0x0000000A);
    info.setFileSize(5);
    info.setCRC32(0x0000000B);
    info.setLastModifyTime(-2);
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(0, info.saveObject(s));
    EXPECT_EQ("00 00 00 02 70 00 00 00 02 6E 00 00 00 02 30 00 00 00 02 30 "
              "00 00 0D 02 "
              "00 00 00 00 00 00 00 05 "
              "FF FF FF FE "
              "00 00 00 0B "
              "00 00 00 0A",
              hex(file.bytes));
}

TEST(FsFileInfoRecord, LoadClearsTheRecordFirst) {
    FsFileInfo info;
    info.setFilePath(L"/old");
    info.setFileName(L"old");
    info.setCRC32(77);
    info.setFileSize(12);
    MemoryFile file(unhex("00 00 00 02 61 00 00 00 02 62 00 00 00 02 30 00 00 00 02 30 "
                          "00 00 00 01 00 00 20 00"));
    FsSerializator_OnFile s(&file, false);
    ASSERT_EQ(0, info.loadObject(s));
    EXPECT_STREQ(L"a", info.getPath());
    EXPECT_EQ(0x1u, info.getValidMask());
    EXPECT_EQ(0x2000u, info.getAttr());
    EXPECT_EQ(0u, info.getCRC32());
}

TEST(FsFileInfoRecord, TimesComeBackSigned) {
    FsFileInfo info;
    info.setFilePath(L"p");
    info.setFileName(L"n");
    info.setLastAccessTime(-5);
    info.setCreateTime(0x7FFFFFFF);
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    ASSERT_EQ(0, info.saveObject(s));
    file.seek(0, 1);
    FsFileInfo back;
    ASSERT_EQ(0, back.loadObject(s));
    EXPECT_EQ(-5L, back.getLastAccessTime());
    EXPECT_EQ(0x7FFFFFFFL, back.getCreateTime());
}

TEST(FsFileInfoRecord, SaveWithoutPathOrNameFailsAndWritesNothing) {
    FsFileInfo noPath;
    noPath.setFileName(L"n");
    MemoryFile file;
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(-1, noPath.saveObject(s));
    EXPECT_EQ("", hex(file.bytes));

    FsFileInfo noName;
    noName.setFilePath(L"/p");
    FsSerializator_OnFile s2(&file, false);
    EXPECT_EQ(-1, noName.saveObject(s2));
    EXPECT_EQ("", hex(file.bytes));
}

TEST(FsFileInfoRecord, SaveReturnsTheStoredErrorOfTheSerialiser) {
    FsFileInfo info;
    info.setFilePath(L"p");
    info.setFileName(L"n");
    MemoryFile file;
    file.writeLimit = 7;
    FsSerializator_OnFile s(&file, false);
    EXPECT_EQ(-1, info.saveObject(s));
}

// A serialiser that fails from the start and counts what it is asked.
class FailingSerializator : public FsSerializator {
public:
    bool saveString(wchar_t const*) override { return false; }
    bool saveInteger32(int) override { return false; }
    bool saveUnsigned32(unsigned int) override { return false; }
    bool saveUnsigned64(unsigned long long) override { return false; }
    wchar_t* loadString() override {
        ++strings;
        return nullptr;
    }
    int loadInteger32() override { return 0; }
    unsigned int loadUnsigned32() override {
        ++words;
        return 0;
    }
    unsigned long long loadUnsigned64() override { return 0; }
    int getLastError() override { return -1; }
    void reset() override {}
    int strings = 0;
    int words = 0;
};

TEST(FsFileInfoRecord, AFailedItemDoesNotStopTheLoadLoop) {
    FailingSerializator s;
    FsFileInfo info;
    info.setFilePath(L"/old");
    EXPECT_EQ(-1, info.loadObject(s));
    EXPECT_EQ(4, s.strings);
    EXPECT_EQ(1, s.words);  // the mask, which reads 0: nothing else follows
    EXPECT_EQ(nullptr, info.getPath());
    EXPECT_EQ(0u, info.getValidMask());
}

TEST(FsFileInfoRecord, TruncatedRecordFailsAndLeavesNoHalfValues) {
    std::string full = unhex(kFullRecord);
    MemoryFile file(full.substr(0, full.size() - 2));
    FsSerializator_OnFile s(&file, false);
    FsFileInfo info;
    EXPECT_EQ(-1, info.loadObject(s));
    EXPECT_EQ(0u, info.getQ32());
}

}  // namespace
