// The key sum eight bytes at a time answers as the byte-by-byte sum through
// the upper-case table: on every length up to five words, word by word with
// the tail read as a word or byte by byte, on plain text of every byte class
// and on text with a byte that is not plain anywhere in it.
#include <gtest/gtest.h>

#include <cstdint>
#include <random>
#include <string>
#include <vector>

#include "fscanner/fscommon/keyhash.h"

namespace {

// The table a C or UTF-8 locale gives: a..z upper-cased, other plain bytes
// kept, zero and the high bytes marked.
std::vector<uint32_t> plainTable() {
    std::vector<uint32_t> upper(256);
    for (uint32_t b = 0; b < 256; ++b)
        upper[b] = b == 0 || b >= 128 ? keyhash::kNotPlainMark : (b >= 'a' && b <= 'z' ? b - 0x20 : b);
    return upper;
}

// The sum as the index's hash takes it from a wide key, character by
// character, upper-cased by hand: the reference both ways must meet.
uint32_t wideSum(const std::string& text) {
    uint32_t acc = 0;
    for (unsigned char b : text) acc = acc * 37u + (b >= 'a' && b <= 'z' ? b - 0x20u : b);
    return acc;
}

// Both sums of text, held at the start of a buffer with slack bytes of
// filler behind it (readable: the text and the slack).
void expectSame(const std::string& text, uint32_t slack, unsigned char filler) {
    std::vector<unsigned char> buffer(text.begin(), text.end());
    buffer.insert(buffer.end(), slack, filler);
    std::vector<uint32_t> upper = plainTable();
    uint32_t marks = 0;
    uint32_t byTable = keyhash::upperSumTable(buffer.data(), static_cast<uint32_t>(text.size()), upper.data(), &marks);
    bool tablePlain = (marks & keyhash::kNotPlainMark) == 0;
    bool plain = !tablePlain;
    uint32_t byWords = keyhash::upperSumWords(buffer.data(), static_cast<uint32_t>(text.size()),
                                              static_cast<uint32_t>(buffer.size()), &plain);
    ASSERT_EQ(plain, tablePlain) << "length " << text.size() << " slack " << slack;
    if (tablePlain) {
        ASSERT_EQ(byWords, byTable) << "length " << text.size() << " slack " << slack;
        ASSERT_EQ(byTable, wideSum(text));
    }
}

TEST(KeyHashTest, ConstantsHold) {
    EXPECT_EQ(keyhash::power37(0), 1u);
    EXPECT_EQ(keyhash::power37(8), 37u * 37u * 37u * 37u * 37u * 37u * 37u * 37u);
    for (unsigned int k = 0; k <= 8; ++k) EXPECT_EQ(keyhash::power37(k) * keyhash::inversePower37(k), 1u) << k;
}

TEST(KeyHashTest, WordsAnswerAsTheTableOnPlainText) {
    if (!keyhash::kWordsServe) GTEST_SKIP() << "the word sum serves little-endian machines only";
    std::mt19937 random(20261125);
    // Every plain byte, and the letters at the edges of the case ranges.
    std::string alphabet;
    for (int b = 1; b < 128; ++b) alphabet.push_back(static_cast<char>(b));
    std::string edges = "@AZ[`az{~\x01\x7f";
    for (uint32_t length = 0; length <= 40; ++length) {
        for (int round = 0; round < 100; ++round) {
            const std::string& from = round % 2 ? alphabet : edges;
            std::string text;
            for (uint32_t i = 0; i < length; ++i) text.push_back(from[random() % from.size()]);
            // Read as words to its end, its tail as a word, its tail byte by
            // byte.
            for (uint32_t slack : {0u, 3u, 7u, 8u, 24u})
                for (unsigned char filler : {0x00, 0x61, 0xFF}) expectSame(text, slack, filler);
        }
    }
}

TEST(KeyHashTest, AByteThatIsNotPlainIsSeenWhereverItStands) {
    if (!keyhash::kWordsServe) GTEST_SKIP() << "the word sum serves little-endian machines only";
    for (uint32_t length = 1; length <= 30; ++length) {
        for (uint32_t at = 0; at < length; ++at) {
            for (unsigned char odd : {0x00, 0x80, 0xC3, 0xFF}) {
                std::string text(length, 'q');
                text[at] = static_cast<char>(odd);
                for (uint32_t slack : {0u, 8u, 24u}) expectSame(text, slack, 'a');
            }
        }
    }
}

TEST(KeyHashTest, BytesBehindTheTextDoNotCount) {
    if (!keyhash::kWordsServe) GTEST_SKIP() << "the word sum serves little-endian machines only";
    // A high byte or a zero right behind the text is not the text's.
    for (uint32_t length = 0; length <= 33; ++length) {
        std::string text(length, 'm');
        for (unsigned char filler : {0x00, 0x80, 0xFF}) {
            std::vector<unsigned char> buffer(text.begin(), text.end());
            buffer.insert(buffer.end(), 24, filler);
            bool plain = false;
            uint32_t sum = keyhash::upperSumWords(buffer.data(), length, static_cast<uint32_t>(buffer.size()), &plain);
            EXPECT_TRUE(plain) << length;
            EXPECT_EQ(sum, wideSum(text)) << length;
        }
    }
}

// A number's sum is that of its decimal text with the terminator, as the
// index sums the text it files a number under.
TEST(KeyHashTest, ANumberSumsAsItsDecimalText) {
    auto textSum = [](uint32_t value) {
        uint32_t acc = 0;
        for (char c : std::to_string(value)) acc = acc * 37u + static_cast<unsigned char>(c);
        return acc * 37u;
    };
    std::vector<uint32_t> values;
    for (uint32_t v = 0; v < 20000; ++v) values.push_back(v);
    for (uint32_t p = 10; p <= 1000000000u; p *= 10) {
        values.push_back(p - 1);
        values.push_back(p);
        values.push_back(p + 1);
    }
    values.push_back(4294967295u);
    values.push_back(4294967294u);
    std::mt19937 random(7);
    for (int i = 0; i < 100000; ++i) values.push_back(static_cast<uint32_t>(random()));
    for (uint32_t v : values) ASSERT_EQ(keyhash::decimalKeySum(v), textSum(v)) << v;
}

}  // namespace
