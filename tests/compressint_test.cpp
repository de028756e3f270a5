// compressInt with buffers of every size from 0 to 10: a value is written
// whenever its 7-bit group encoding fits, the bytes are those a roomy buffer
// gets, and nothing outside the encoding is touched.
#include <gtest/gtest.h>

#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/table.h"

namespace {

const unsigned char kGuard = 0xA5;
const int kGuardBytes = 8;
const int kRoomy = 16;

// Bytes of the encoding of value, from a buffer far larger than any encoding.
std::vector<unsigned char> roomyEncoding(unsigned long long value) {
    char buffer[kRoomy];
    std::memset(buffer, static_cast<char>(kGuard), sizeof buffer);
    int first = compressInt(value, buffer, kRoomy);
    EXPECT_GE(first, 0);
    EXPECT_LT(first, kRoomy);
    if (first < 0 || first >= kRoomy) return {};
    return std::vector<unsigned char>(buffer + first, buffer + kRoomy);
}

// Groups of 7 bits a value needs, counted by hand: 1 for 0.
int groupsOf(unsigned long long value) {
    int groups = 1;
    while (value >= 128) {
        value /= 128;
        ++groups;
    }
    return groups;
}

std::vector<unsigned long long> sampleValues() {
    std::vector<unsigned long long> values = {0ull, 1ull, 5ull, 127ull, 128ull, 300ull, 16383ull,
                                              16384ull, 0xFFFFFFFFull, ~0ull};
    for (int bit = 0; bit < 64; ++bit) {
        unsigned long long power = 1ull << bit;
        values.push_back(power);
        values.push_back(power - 1);
        values.push_back(power + 1);
    }
    return values;
}

std::string hexOf(const unsigned char* bytes, size_t count) {
    static const char digits[] = "0123456789abcdef";
    std::string text;
    for (size_t i = 0; i < count; ++i) {
        text += digits[bytes[i] >> 4];
        text += digits[bytes[i] & 15];
    }
    return text;
}

}  // namespace

TEST(CompressIntSmallBuffer, FiveInFourBytesIsOneByteAtTheEnd) {
    char buffer[4];
    std::memset(buffer, static_cast<char>(kGuard), sizeof buffer);
    EXPECT_EQ(3, compressInt(5, buffer, 4));
    // 5 is one group, shifted left by one, continuation bit clear.
    EXPECT_EQ(0x0A, static_cast<unsigned char>(buffer[3]));
    EXPECT_EQ(kGuard, static_cast<unsigned char>(buffer[0]));
    EXPECT_EQ(kGuard, static_cast<unsigned char>(buffer[1]));
    EXPECT_EQ(kGuard, static_cast<unsigned char>(buffer[2]));
    EXPECT_EQ(5ull, decompressInt(buffer + 3));
}

TEST(CompressIntSmallBuffer, LiteralEncodingsInBuffersOfExactlyTheirLength) {
    struct Case {
        unsigned long long value;
        int size;
        const char* hex;
    };
    const Case cases[] = {
        {0ull, 1, "00"},
        {1ull, 1, "02"},
        {127ull, 1, "fe"},
        {128ull, 2, "0300"},
        {300ull, 2, "0558"},
        {16383ull, 2, "fffe"},
        {16384ull, 3, "030100"},
        {0xFFFFFFFFull, 5, "1ffffffffe"},
        {~0ull, 10, "03fffffffffffffffffe"},
    };
    for (const Case& c : cases) {
        char buffer[10];
        std::memset(buffer, static_cast<char>(kGuard), sizeof buffer);
        EXPECT_EQ(0, compressInt(c.value, buffer, c.size)) << c.value;
        EXPECT_EQ(std::string(c.hex),
                  hexOf(reinterpret_cast<unsigned char*>(buffer), static_cast<size_t>(c.size)))
            << c.value;
        EXPECT_EQ(c.value, decompressInt(buffer)) << c.value;
    }
}

TEST(CompressIntSmallBuffer, OneByteTooFewIsRefusedAndWritesNothing) {
    const unsigned long long values[] = {128ull, 300ull, 16384ull, 0xFFFFFFFFull, ~0ull};
    const int sizes[] = {1, 1, 2, 4, 9};
    for (size_t i = 0; i < sizeof values / sizeof values[0]; ++i) {
        char buffer[10];
        std::memset(buffer, static_cast<char>(kGuard), sizeof buffer);
        EXPECT_EQ(-1, compressInt(values[i], buffer, sizes[i])) << values[i];
        for (unsigned char b : buffer) EXPECT_EQ(kGuard, b) << values[i];
    }
}

TEST(CompressIntSmallBuffer, EveryValueFitsExactlyWhenItsEncodingDoes) {
    for (unsigned long long value : sampleValues()) {
        const std::vector<unsigned char> expected = roomyEncoding(value);
        const int length = static_cast<int>(expected.size());
        ASSERT_EQ(groupsOf(value), length) << value;
        for (int size = 0; size <= 10; ++size) {
            // Guard bytes on both sides of the buffer handed over.
            std::vector<unsigned char> area(static_cast<size_t>(kGuardBytes + size + kGuardBytes), kGuard);
            char* buffer = reinterpret_cast<char*>(area.data() + kGuardBytes);
            int first = compressInt(value, buffer, size);
            if (length <= size) {
                ASSERT_EQ(size - length, first) << value << " in " << size;
                EXPECT_EQ(expected, std::vector<unsigned char>(area.begin() + kGuardBytes + first,
                                                               area.begin() + kGuardBytes + size))
                    << value << " in " << size;
                EXPECT_EQ(value, decompressInt(buffer + first)) << value << " in " << size;
                // Nothing before the encoding is written either.
                for (int i = 0; i < kGuardBytes + first; ++i)
                    EXPECT_EQ(kGuard, area[static_cast<size_t>(i)]) << value << " in " << size;
            } else {
                EXPECT_EQ(-1, first) << value << " in " << size;
                for (int i = 0; i < kGuardBytes + size; ++i)
                    EXPECT_EQ(kGuard, area[static_cast<size_t>(i)]) << value << " in " << size;
            }
            for (int i = kGuardBytes + size; i < static_cast<int>(area.size()); ++i)
                EXPECT_EQ(kGuard, area[static_cast<size_t>(i)]) << value << " in " << size;
        }
    }
}

TEST(CompressIntSmallBuffer, NegativeSizeAndNullBufferAreRefused) {
    char buffer[4];
    std::memset(buffer, static_cast<char>(kGuard), sizeof buffer);
    EXPECT_EQ(-1, compressInt(0, buffer, -1));
    EXPECT_EQ(-1, compressInt(0, nullptr, 4));
    for (unsigned char b : buffer) EXPECT_EQ(kGuard, b);
}
