// Serialiser of result records, and its encoding on a file.
//
// Result file encoding (every result file, no header, no separator between
// records):
//
//   unsigned 32-bit   4 bytes, most significant first
//   signed 32-bit     the same 4 bytes as its unsigned form
//   unsigned 64-bit   8 bytes, most significant first
//   string            unsigned 32-bit count = UTF-8 byte length + 1, then the
//                     UTF-8 bytes with no terminator.  The count includes a
//                     terminator that is not stored: "" is 00 00 00 01.  A
//                     count of 0 is never written; reading one gives null.
//
// Record (FsFileInfo::saveObject / loadObject), in this order:
//
//   path, name, md5, sha256        string each, always
//   presence mask                  unsigned 32-bit, always
//   then, only when its mask bit is set, in rising bit order:
//   0x1 attr (u32)  0x2 size (u64)  0x4 device low word (u32)  0x8 group id
//   0x10 user id  0x20 inode  0x40 last access time  0x80 create time
//   0x100 last modify time  0x200 link count  0x400 CRC32  0x800 Q32
//   (all u32 but size; times are the low 32 bits of the signed seconds)
//
// Errors latch: after the first failed operation every save does nothing and
// returns false, every load returns 0 or null, until reset().  The only error
// value is -1.  A truncated record thus ends reading at its start, as far as
// the caller can tell.
#ifndef FSCANNER_FS_FS_SERIALIZER_H
#define FSCANNER_FS_FS_SERIALIZER_H

#include <cstdint>
#include <cwchar>

#include "fscanner/fscommon/stringhelper.h"

class AbstractFile;

// Byte offsets and sizes of the result file encoding.
namespace resultfile {
const unsigned int kUnsigned32Size = 4;
const unsigned int kUnsigned64Size = 8;
const unsigned int kStringCountSize = 4;
// Strings whose count is at most this are loaded through the serialiser's
// inline buffer; longer ones through a block of their own.
const unsigned int kInlineStringCount = 127;
const unsigned int kInlineBufferSize = 128;
}  // namespace resultfile

// Abstract serialiser.  The order of the virtual operations is an ABI.
class FsSerializator {
public:
    // Each save returns true when the serialiser holds no error afterwards.
    // text must not be null.
    virtual bool saveString(wchar_t const* text) = 0;
    virtual bool saveInteger32(int value) = 0;
    virtual bool saveUnsigned32(unsigned int value) = 0;
    virtual bool saveUnsigned64(unsigned long long value) = 0;
    // A new[] string owned by the caller (release with delete[]); null after
    // an error or for a stored null.
    virtual wchar_t* loadString() = 0;
    // 0 after an error.
    virtual int loadInteger32() = 0;
    virtual unsigned int loadUnsigned32() = 0;
    virtual unsigned long long loadUnsigned64() = 0;
    // 0, or -1 once an operation has failed.
    virtual int getLastError() = 0;
    // Forgets the stored error.
    virtual void reset() = 0;
    virtual ~FsSerializator() {}
};

// The serialiser on an AbstractFile, big-endian with UTF-8 strings.  It reads
// and writes at the file's current position.  It does not own the file
// object: with closeAtEnd it calls close() on it at its end, and it never
// deletes it.  One thread at a time.
class FsSerializator_OnFile : public FsSerializator {
public:
    // A null file gives a serialiser that starts with the error -1.
    FsSerializator_OnFile(AbstractFile* file, bool closeAtEnd);
    ~FsSerializator_OnFile() override;

    // Refuses null: stores -1, writes nothing, returns false.
    bool saveString(wchar_t const* text) override;
    bool saveInteger32(int value) override;
    bool saveUnsigned32(unsigned int value) override;
    bool saveUnsigned64(unsigned long long value) override;
    // A count that promises more bytes than the file holds behind it is
    // damage: -1 is stored and null returned, with nothing allocated.
    wchar_t* loadString() override;
    int loadInteger32() override;
    unsigned int loadUnsigned32() override;
    unsigned long long loadUnsigned64() override;
    int getLastError() override;
    void reset() override;

private:
    FsSerializator_OnFile(const FsSerializator_OnFile&);
    FsSerializator_OnFile& operator=(const FsSerializator_OnFile&);

    // True when length bytes lie between the position and the end of the file
    // (also when the end cannot be learnt: the read then decides).
    bool bytesAvailable(unsigned int length);

    AbstractFile* file;
    bool closeAtEnd;
    int lastError;
    // UTF-8 form of the string being saved; grows, never shrinks.
    utils::DynamicBuffer<unsigned char> utf8Buffer;
    // Spare buffer of the same kind, released at the end.
    utils::DynamicBuffer<unsigned char> spareBuffer;
    // Bytes of a string with a count up to 127 while it is loaded.
    unsigned char shortString[resultfile::kInlineBufferSize];
};

#endif
