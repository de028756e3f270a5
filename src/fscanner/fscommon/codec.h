// The one byte codec of the library.
//
// Every integer or string that goes to disk passes through these functions, so
// no other file shifts bytes by hand.  Four families:
//
//   host order    putFixed32/getFixed32, putFixed64/getFixed64: the machine's
//                 own byte order (little-endian on the target).  Table, index
//                 and pointer files use it.
//   big-endian    putBig32/getBig32, putBig64/getBig64: most significant byte
//                 first.  Result files use it.
//   7-bit groups  putCompressed/getCompressed: big-endian groups of 7 bits,
//                 most significant group first, no leading empty group.  In
//                 each byte bits 7..1 hold the group and bit 0 is 1 when
//                 another byte follows.  0 is the single byte 0x00; 1 is 0x02,
//                 127 is 0xFE, 128 is 0x03 0x00, 300 is 0x05 0x58.  A 64-bit
//                 value takes at most kMaxCompressedLength bytes.
//   length-prefixed bytes
//                 putPrefixed16 (2-byte host-order length), putPrefixedCompressed
//                 (7-bit group length), putPrefixedBig32Plus1 (big-endian count
//                 that is the byte length plus 1).
//
// Raw pointer forms write to memory the caller sized; the std::string forms
// append.  Decoding goes through ByteReader, a cursor over a bounded buffer
// whose every get* returns false, and consumes nothing, when the bytes would
// run past the end: damaged input can never make a reader leave its buffer.
//
// Everything here is pure computation over caller memory: no allocation except
// in the std::string forms, no global state, safe from any thread.
#ifndef FSCANNER_FSCOMMON_CODEC_H
#define FSCANNER_FSCOMMON_CODEC_H

#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>

namespace codec {

// Longest 7-bit group encoding of a 64-bit value: ceil(64 / 7).
const int kMaxCompressedLength = 10;

// ---- host order -----------------------------------------------------------

inline void encodeFixed32(char* dst, uint32_t value) { std::memcpy(dst, &value, 4); }
inline void encodeFixed64(char* dst, uint64_t value) { std::memcpy(dst, &value, 8); }
inline void encodeFixed16(char* dst, uint16_t value) { std::memcpy(dst, &value, 2); }

inline uint32_t decodeFixed32(const char* src) {
    uint32_t value;
    std::memcpy(&value, src, 4);
    return value;
}
inline uint64_t decodeFixed64(const char* src) {
    uint64_t value;
    std::memcpy(&value, src, 8);
    return value;
}
inline uint16_t decodeFixed16(const char* src) {
    uint16_t value;
    std::memcpy(&value, src, 2);
    return value;
}

inline void putFixed16(std::string* dst, uint16_t value) {
    char buf[2];
    encodeFixed16(buf, value);
    dst->append(buf, 2);
}
inline void putFixed32(std::string* dst, uint32_t value) {
    char buf[4];
    encodeFixed32(buf, value);
    dst->append(buf, 4);
}
inline void putFixed64(std::string* dst, uint64_t value) {
    char buf[8];
    encodeFixed64(buf, value);
    dst->append(buf, 8);
}

// ---- big-endian -------------------------------------------------------------

inline void encodeBig32(char* dst, uint32_t value) {
    unsigned char* p = reinterpret_cast<unsigned char*>(dst);
    p[0] = static_cast<unsigned char>(value >> 24);
    p[1] = static_cast<unsigned char>(value >> 16);
    p[2] = static_cast<unsigned char>(value >> 8);
    p[3] = static_cast<unsigned char>(value);
}
inline void encodeBig64(char* dst, uint64_t value) {
    encodeBig32(dst, static_cast<uint32_t>(value >> 32));
    encodeBig32(dst + 4, static_cast<uint32_t>(value));
}
inline uint32_t decodeBig32(const char* src) {
    const unsigned char* p = reinterpret_cast<const unsigned char*>(src);
    return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
           (static_cast<uint32_t>(p[2]) << 8) | static_cast<uint32_t>(p[3]);
}
inline uint64_t decodeBig64(const char* src) {
    return (static_cast<uint64_t>(decodeBig32(src)) << 32) | decodeBig32(src + 4);
}
inline void putBig32(std::string* dst, uint32_t value) {
    char buf[4];
    encodeBig32(buf, value);
    dst->append(buf, 4);
}
inline void putBig64(std::string* dst, uint64_t value) {
    char buf[8];
    encodeBig64(buf, value);
    dst->append(buf, 8);
}

// ---- 7-bit groups -----------------------------------------------------------

// Writes the encoding of value at the END of buffer[0..size) and returns the
// index of its first byte; the encoded length is size minus that index.  Zero
// is one byte 0x00, so the result for 0 is size - 1.  A buffer too small for
// the encoding (or a null one) gets -1 and nothing written.
inline int compressedLength(uint64_t value);
inline int encodeCompressedBackward(uint64_t value, char* buffer, int size) {
    if (buffer == nullptr || size < compressedLength(value)) return -1;
    int index = size - 1;
    // Last byte: continuation bit clear.
    buffer[index] = static_cast<char>((value & 0x7F) << 1);
    value >>= 7;
    while (value != 0) {
        --index;
        buffer[index] = static_cast<char>(((value & 0x7F) << 1) | 1);
        value >>= 7;
    }
    return index;
}

// Number of bytes encodeCompressedBackward produces for value.
inline int compressedLength(uint64_t value) {
    int n = 1;
    while (value >>= 7) ++n;
    return n;
}

inline void putCompressed(std::string* dst, uint64_t value) {
    char buf[16];
    int first = encodeCompressedBackward(value, buf, 16);
    dst->append(buf + first, 16 - first);
}

// Decodes one 7-bit group value from src, reading no more than limit bytes
// (and never more than kMaxCompressedLength).  Returns the bytes consumed, or
// 0 when the encoding does not end inside that window.
inline int decodeCompressed(const char* src, size_t limit, uint64_t* value) {
    uint64_t result = 0;
    size_t max = limit < static_cast<size_t>(kMaxCompressedLength) ? limit
                                                                   : static_cast<size_t>(kMaxCompressedLength);
    for (size_t i = 0; i < max; ++i) {
        unsigned char b = static_cast<unsigned char>(src[i]);
        result = (result << 7) | (b >> 1);
        if ((b & 1) == 0) {
            *value = result;
            return static_cast<int>(i + 1);
        }
    }
    return 0;
}

// ---- length-prefixed bytes --------------------------------------------------

// 2-byte host-order length, then the bytes.  The length is cut to 16 bits and
// only that many bytes follow (a longer text is stored cut at its length
// modulo 65536).
inline void putPrefixed16(std::string* dst, const char* bytes, size_t length) {
    uint16_t stored = static_cast<uint16_t>(length);
    putFixed16(dst, stored);
    dst->append(bytes, stored);
}
// Same cut to 16 bits, with the length as 7-bit groups.
inline void putPrefixedCompressed(std::string* dst, const char* bytes, size_t length) {
    uint16_t stored = static_cast<uint16_t>(length);
    putCompressed(dst, stored);
    dst->append(bytes, stored);
}
// Big-endian 32-bit count that is the byte length plus 1 (a terminator that is
// not stored), then the bytes.  An empty text is 00 00 00 01.
inline void putPrefixedBig32Plus1(std::string* dst, const char* bytes, uint32_t length) {
    putBig32(dst, length + 1);
    dst->append(bytes, length);
}

// ---- bounded reader ---------------------------------------------------------

// Cursor over [data, data + size).  Does not own the bytes.  Each get* either
// consumes its whole item and returns true, or returns false and leaves the
// cursor where it was.
class ByteReader {
public:
    ByteReader(const char* data, size_t size) : data_(data), size_(size), pos_(0) {}

    size_t position() const { return pos_; }
    size_t remaining() const { return size_ - pos_; }
    const char* current() const { return data_ + pos_; }

    bool skip(size_t n) {
        if (n > remaining()) return false;
        pos_ += n;
        return true;
    }
    bool getBytes(void* dst, size_t n) {
        if (n > remaining()) return false;
        std::memcpy(dst, data_ + pos_, n);
        pos_ += n;
        return true;
    }
    bool getFixed8(uint8_t* v) { return getBytes(v, 1); }
    bool getFixed16(uint16_t* v) {
        if (remaining() < 2) return false;
        *v = decodeFixed16(current());
        pos_ += 2;
        return true;
    }
    bool getFixed32(uint32_t* v) {
        if (remaining() < 4) return false;
        *v = decodeFixed32(current());
        pos_ += 4;
        return true;
    }
    bool getFixed64(uint64_t* v) {
        if (remaining() < 8) return false;
        *v = decodeFixed64(current());
        pos_ += 8;
        return true;
    }
    bool getBig32(uint32_t* v) {
        if (remaining() < 4) return false;
        *v = decodeBig32(current());
        pos_ += 4;
        return true;
    }
    bool getBig64(uint64_t* v) {
        if (remaining() < 8) return false;
        *v = decodeBig64(current());
        pos_ += 8;
        return true;
    }
    bool getCompressed(uint64_t* v) {
        int n = decodeCompressed(current(), remaining(), v);
        if (n == 0) return false;
        pos_ += static_cast<size_t>(n);
        return true;
    }

private:
    const char* data_;
    size_t size_;
    size_t pos_;
};

}  // namespace codec

#endif
