#ifndef FSCANNER_FSCOMMON_KEYHASH_H
#define FSCANNER_FSCOMMON_KEYHASH_H

// The sum an index files a text key under, taken on the key's stored UTF-8
// bytes: acc = acc * 37 + c for each character c, upper-cased, modulo 2^32
// (hash() in table.h ends it).  Plain ASCII only (bytes 1..127), where one
// byte is one character; for any other byte the answer says "not plain" and
// the sum is not used.
//
// Two ways to the same sum.  upperSumTable looks each byte up in the table
// FS_Table::upperAsciiTable() builds (a byte no plain text holds carries
// kNotPlainMark).  upperSumWords takes eight bytes at a time and upper-cases
// them itself, so it serves only where that table maps a..z to A..Z and every
// other plain byte to itself, as the C and UTF-8 locales do.  The walk over
// a table's rows hashes every row's name, and names are mostly longer than
// eight bytes: one step of a few multiplies replaces eight lookups, and the
// loop ends by the length's eighths, not byte by byte.

#include <cstdint>
#include <cstring>

namespace keyhash {

// The mark of a byte that no plain ASCII text holds; no character's upper
// case has this bit.
const uint32_t kNotPlainMark = 0x80000000u;

constexpr uint32_t power37(unsigned int k) { return k == 0 ? 1u : 37u * power37(k - 1); }

// The inverse of 37 modulo 2^32 (37 is odd): x * (2 - 37 * x) doubles the
// bits that are right, from the three 37 itself gets right.
constexpr uint32_t inverseStep(uint32_t x) { return x * (2u - 37u * x); }
constexpr uint32_t kInverse37 = inverseStep(inverseStep(inverseStep(inverseStep(inverseStep(37u)))));
static_assert(kInverse37 * 37u == 1u, "37 is invertible modulo 2^32");

constexpr uint32_t inversePower37(unsigned int k) { return k == 0 ? 1u : kInverse37 * inversePower37(k - 1); }

// The powers a tail of k < 8 bytes needs, looked up rather than computed:
// a tail summed as if padded with zeros to a word comes out 37^(8 - k)
// times its own sum.
struct TailPowers {
    uint32_t power[8];    // 37^k
    uint32_t inverse[9];  // 37^-k
};
constexpr TailPowers kTailPowers = {
    {power37(0), power37(1), power37(2), power37(3), power37(4), power37(5), power37(6), power37(7)},
    {inversePower37(0), inversePower37(1), inversePower37(2), inversePower37(3), inversePower37(4),
     inversePower37(5), inversePower37(6), inversePower37(7), inversePower37(8)}};

// The sum of length bytes at text, from acc 0, through the table; *marks
// gathers the table's values, so (*marks & kNotPlainMark) says "not plain".
inline uint32_t upperSumTable(const unsigned char* text, uint32_t length, const uint32_t* upper, uint32_t* marks) {
    uint32_t acc = 0;
    uint32_t seen = 0;
    uint32_t i = 0;
    // Four characters a step: acc * 37^4 + u0 * 37^3 + u1 * 37^2 + u2 * 37 + u3
    // is the same sum modulo 2^32, with one multiply of acc where there were four.
    for (; i + 4 <= length; i += 4) {
        uint32_t u0 = upper[text[i]], u1 = upper[text[i + 1]], u2 = upper[text[i + 2]], u3 = upper[text[i + 3]];
        acc = acc * power37(4) + (u0 * power37(3) + u1 * power37(2)) + (u2 * 37u + u3);
        seen |= (u0 | u1) | (u2 | u3);
    }
    for (; i < length; ++i) {
        uint32_t u = upper[text[i]];
        acc = acc * 37u + u;
        seen |= u;
    }
    *marks |= seen;
    return acc;
}

#if defined(__BYTE_ORDER__) && __BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__
const bool kWordsServe = true;
#else
const bool kWordsServe = false;
#endif

namespace detail {

const uint64_t kOnes = 0x0101010101010101ull;
const uint64_t kHighs = 0x8080808080808080ull;

// Eight bytes, the first the lowest: the high bits of the bytes that are not
// plain (a high bit, or zero) are set in *bad; the others are upper-cased
// (a..z less 0x20) when all eight are plain.
inline uint64_t upperWord(uint64_t x, uint64_t* bad) {
    *bad |= (x & kHighs) | ((x - kOnes) & ~x & kHighs);
    // For bytes below 0x80 neither sum carries into the next byte: the high
    // bit of x + 0x1F is "at least 'a'", of x + 0x05 "above 'z'".
    uint64_t lower = (x + 0x1F * kOnes) & ~(x + 0x05 * kOnes) & kHighs;
    return x - (lower >> 2);
}

// b0 * 37^7 + b1 * 37^6 + ... + b7, modulo 2^32, of the eight bytes of x
// (b0 the lowest): pairs b0 * 37 + b1 in 16-bit lanes (at most
// 255 * 37 + 255), then fours p0 * 37^2 + p1 in 32-bit lanes (at most
// 9690 * 1369 + 9690), so no lane carries into the next.
inline uint32_t sumWord(uint64_t x) {
    const uint64_t pairLow = 0x00FF00FF00FF00FFull;
    const uint64_t fourLow = 0x0000FFFF0000FFFFull;
    uint64_t pairs = (x & pairLow) * 37u + ((x >> 8) & pairLow);
    uint64_t fours = (pairs & fourLow) * power37(2) + ((pairs >> 16) & fourLow);
    return static_cast<uint32_t>(fours) * power37(4) + static_cast<uint32_t>(fours >> 32);
}

inline uint64_t loadWord(const unsigned char* p) {
    uint64_t x;
    std::memcpy(&x, p, 8);
    return x;
}

// The word of the first n (0..8) bytes: the low n bytes set.
constexpr uint64_t kKeep[9] = {0,
                               0xFFull,
                               0xFFFFull,
                               0xFFFFFFull,
                               0xFFFFFFFFull,
                               0xFFFFFFFFFFull,
                               0xFFFFFFFFFFFFull,
                               0xFFFFFFFFFFFFFFull,
                               ~0ull};

// The sum of the word at p of which only the first n bytes (0..8) are the
// text's, as if the others were zeros; the others count as plain.
inline uint32_t sumPart(const unsigned char* p, uint32_t n, uint64_t* bad) {
    uint64_t keep = kKeep[n];
    uint64_t x = (loadWord(p) & keep) | (kOnes & ~keep);
    return sumWord(upperWord(x, bad) & keep);
}

}  // namespace detail

// The sum upperSumTable answers for a table that maps a..z to A..Z and every
// other plain byte to itself, for plain text; *plain says whether it is.
// readable bytes from text on may be read (at least length); where fewer
// than the length rounded up to eight are, the last bytes go one by one.
// Only where kWordsServe.
inline uint32_t upperSumWords(const unsigned char* text, uint32_t length, uint32_t readable, bool* plain) {
    using namespace detail;
    uint64_t bad = 0;
    uint32_t acc = 0;
    uint32_t i = 0;
    for (; i + 8 <= length; i += 8) acc = acc * power37(8) + sumWord(upperWord(loadWord(text + i), &bad));
    uint32_t tail = length - i;
    if (tail != 0 && readable >= i + 8) {
        // The tail's bytes as a word, the rest of it cleared.
        acc = acc * kTailPowers.power[tail] + sumPart(text + i, tail, &bad) * kTailPowers.inverse[8 - tail];
    } else {
        for (; i < length; ++i) {
            uint32_t b = text[i];
            if (b == 0 || b >= 0x80) bad = kHighs;
            acc = acc * 37u + (b >= 'a' && b <= 'z' ? b - 0x20 : b);
        }
    }
    *plain = bad == 0;
    return acc;
}

// The sum an index files a number under: that of its decimal text,
// terminator included (acc * 37 for the terminator's zero).  Taken from the
// lowest digit up, each digit times its power of 37, two digits a step: the
// divisions, each waiting for the one before, are half as many.
inline uint32_t decimalKeySum(uint32_t value) {
    // Two digits "ab" as they add to a sum: ('0' + a) * 37 + '0' + b.
    struct Pairs {
        uint32_t sum[100];
    };
    static constexpr Pairs kPairs = [] {
        Pairs p{};
        for (uint32_t i = 0; i < 100; ++i) p.sum[i] = ('0' + i / 10) * 37u + ('0' + i % 10);
        return p;
    }();
    uint32_t acc = 0;
    uint32_t power = 37;  // of the lowest digit: the terminator follows it
    while (value >= 100) {
        acc += kPairs.sum[value % 100] * power;
        power *= power37(2);
        value /= 100;
    }
    if (value >= 10) return acc + kPairs.sum[value] * power;
    return acc + ('0' + value) * power;
}

}  // namespace keyhash

#endif
