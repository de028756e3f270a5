// The sort of a result file leaves exactly what the natural merge passes on
// disk leave with FsFileInfo records: the same bytes in the same order, ties
// included, and the same pass lines in the trace.  The reference here is
// NaturalMergeSort driven by callbacks that load, save, peek and compare
// whole FsFileInfo records, run on a copy of the same file.
//
// The inputs are chosen where an order could slip: many equal keys (runs that
// join in a scratch file pass equal records of earlier runs), mixed case and
// non-ASCII names under both case rules, records with missing strings (the
// passes drop them at their first write), bytes that load to other text than
// they hold, full paths whose directory is a prefix of another, damaged tails,
// and files that must take the passes on disk.
#include <gtest/gtest.h>

#include <clocale>
#include <cstdint>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "fscanner/fs/fs_serializer.h"
#include "fscanner/fscommon/naturalmerge.h"
#include "fscanner/fscommon/sysfile.h"
#include "support/testsupport.h"

namespace {

// ---- the reference: whole FsFileInfo records through the callbacks -----------

int g_referenceKey = FsFileInfo::COMPARE_FULL_PATH;

bool referenceCompare(void* a, void* b, unsigned int op, bool flag) {
    if (a == nullptr || b == nullptr) return false;
    return static_cast<FsFileInfo*>(a)->compare(*static_cast<FsFileInfo*>(b), g_referenceKey, op, flag);
}

int referenceRead(AbstractFile* file, void** record) {
    *record = nullptr;
    FsFileInfo* info = new FsFileInfo();
    FsSerializator_OnFile serializator(file, false);
    if (info->loadObject(serializator) != 0) {
        delete info;
        file->seek(0, SEEK_FROM_END);  // damage ends the input
        return 0;
    }
    *record = info;
    return 1;
}

int referenceWrite(AbstractFile* file, void* record) {
    if (file == nullptr || record == nullptr) return 0;
    FsSerializator_OnFile serializator(file, false);
    return static_cast<FsFileInfo*>(record)->saveObject(serializator) == 0 ? 1 : 0;
}

bool referencePeek(AbstractFile* file, void** record) {
    *record = nullptr;
    long position = file->tell();
    FsFileInfo* info = new FsFileInfo();
    FsSerializator_OnFile serializator(file, false);
    if (info->loadObject(serializator) == 0 && !file->eof()) {
        file->seek(position, SEEK_FROM_START);
        *record = info;
        return true;
    }
    delete info;
    file->seek(0, SEEK_FROM_END);
    return false;
}

void referenceFree(void* record) {
    delete static_cast<FsFileInfo*>(record);
}

// The pass lines of a trace, in order.
std::vector<std::string> passLines(const testsupport::TraceCapture& capture) {
    std::vector<std::string> lines;
    for (const QvLogWrapper::Message& m : capture.messages()) {
        if (m.text.find("NaturalMergeSort::sort - pass ") != std::string::npos ||
            m.text.find("NaturalMergeSort::sort - still ") != std::string::npos) {
            std::string text = m.text;
            // The file name differs between the two runs.
            size_t bracket = text.find(" on [");
            if (bracket != std::string::npos) text = text.substr(0, bracket);
            lines.push_back(text);
        }
    }
    return lines;
}

struct Outcome {
    std::string bytes;
    std::vector<std::string> passes;
    bool scratchLeft = false;
};

Outcome sortByReference(const testsupport::TempDir& dir, const std::string& content, unsigned int key,
                        unsigned int order, bool flag) {
    std::string path = dir.write("reference", content);
    g_referenceKey = static_cast<int>(key);
    Outcome out;
    {
        testsupport::TraceCapture capture;
        NaturalMergeSort sorter(referenceCompare, referenceRead, referenceWrite, referencePeek,
                                referenceFree);
        std::wstring wide(path.begin(), path.end());
        sorter.sort(&wide[0], order, flag);
        out.passes = passLines(capture);
    }
    out.bytes = testsupport::readFile(path);
    return out;
}

Outcome sortByReader(const testsupport::TempDir& dir, const std::string& content, unsigned int key,
                     unsigned int order, bool flag) {
    std::string path = dir.write("subject", content);
    Outcome out;
    {
        testsupport::TraceCapture capture;
        FsResultSetReader_OnFile reader(path.c_str());
        EXPECT_EQ(1, reader.sort(key, order, flag));
        out.passes = passLines(capture);
        out.bytes = testsupport::readFile(path);
        out.scratchLeft = testsupport::fileExists(path + ".a") || testsupport::fileExists(path + ".b");
    }
    return out;
}

// ---- hand-made record bytes ---------------------------------------------------

void putBig32(std::string& out, uint32_t v) {
    for (int shift = 24; shift >= 0; shift -= 8) out += static_cast<char>((v >> shift) & 0xFF);
}

void putBig64(std::string& out, uint64_t v) {
    for (int shift = 56; shift >= 0; shift -= 8) out += static_cast<char>((v >> shift) & 0xFF);
}

// A string item: its bytes behind a count of length + 1; kMissing writes a
// count of 0, which loads as null.
const char* const kMissing = nullptr;

void putText(std::string& out, const char* bytes, size_t length) {
    if (bytes == nullptr) {
        putBig32(out, 0);
        return;
    }
    putBig32(out, static_cast<uint32_t>(length + 1));
    out.append(bytes, length);
}

void putText(std::string& out, const std::string& bytes) {
    putText(out, bytes.data(), bytes.size());
}

// A record with the given strings, a size and a sequence number in its CRC32
// field (mask 0x402), as the writer lays it out.
std::string record(const char* path, const char* name, uint64_t size, uint32_t seq,
                   const char* md5 = "0", const char* sha256 = "0") {
    std::string out;
    putText(out, path, path != nullptr ? std::strlen(path) : 0);
    putText(out, name, name != nullptr ? std::strlen(name) : 0);
    putText(out, md5, md5 != nullptr ? std::strlen(md5) : 0);
    putText(out, sha256, sha256 != nullptr ? std::strlen(sha256) : 0);
    putBig32(out, FsFileInfo::VALID_SIZE | FsFileInfo::VALID_CRC32);
    putBig64(out, size);
    putBig32(out, seq);
    return out;
}

std::string record(const std::string& path, const std::string& name, uint64_t size, uint32_t seq) {
    std::string out;
    putText(out, path);
    putText(out, name);
    putText(out, "0", 1);
    putText(out, "0", 1);
    putBig32(out, FsFileInfo::VALID_SIZE | FsFileInfo::VALID_CRC32);
    putBig64(out, size);
    putBig32(out, seq);
    return out;
}

// ---- the fixture ----------------------------------------------------------------

class ResultSortOrderTest : public ::testing::Test {
protected:
    void SetUp() override {
        // Lowering of non-ASCII letters follows the locale, as in the tool.
        const char* current = std::setlocale(LC_CTYPE, nullptr);
        savedLocale = current != nullptr ? current : "C";
        if (std::setlocale(LC_CTYPE, "C.UTF-8") == nullptr) std::setlocale(LC_CTYPE, "C");
        savedLimit = NaturalMergeReplay::limitBytes();
    }
    void TearDown() override {
        std::setlocale(LC_CTYPE, savedLocale.c_str());
        NaturalMergeReplay::setLimitBytes(savedLimit);
    }

    // Every key in both orders under both case rules, in memory and through
    // the passes on disk, against the reference.
    void expectSameAsReference(const std::string& content, const std::string& what) {
        for (unsigned int key = 1; key <= 4; ++key) {
            for (unsigned int order = 1; order <= 2; ++order) {
                for (int flag = 0; flag <= 1; ++flag) {
                    Outcome expected = sortByReference(dir, content, key, order, flag == 1);
                    for (uint32_t limit : {savedLimit, 0u}) {
                        NaturalMergeReplay::setLimitBytes(limit);
                        Outcome got = sortByReader(dir, content, key, order, flag == 1);
                        NaturalMergeReplay::setLimitBytes(savedLimit);
                        std::string where = what + ": key " + std::to_string(key) + " order " +
                                            std::to_string(order) + " case-sensitive " +
                                            std::to_string(flag) + (limit == 0 ? " (on disk)" : " (in memory)");
                        EXPECT_TRUE(expected.bytes == got.bytes) << where;
                        EXPECT_EQ(expected.passes, got.passes) << where;
                        EXPECT_FALSE(got.scratchLeft) << where;
                    }
                }
            }
        }
    }

    testsupport::TempDir dir;
    std::string savedLocale;
    uint32_t savedLimit = 0;
};

// Records drawn from small sets of directories, names and sizes, so that
// every key has many equal values.
std::string recordsWithManyTies(size_t count, unsigned int seed) {
    static const char* const kPaths[] = {"/a", "/a/b", "/a-b", "/a.b", "/A", "/", "", "/a/", "/z/y/x",
                                         "/a/b/c"};
    static const char* const kNames[] = {"x", "X", "y", "b", "B", "c", "a.b", "-", "x"};
    std::mt19937 random(seed);
    std::string out;
    for (size_t i = 0; i < count; ++i) {
        const char* path = kPaths[random() % (sizeof kPaths / sizeof kPaths[0])];
        const char* name = kNames[random() % (sizeof kNames / sizeof kNames[0])];
        out += record(path, name, random() % 5, static_cast<uint32_t>(i));
    }
    return out;
}

TEST_F(ResultSortOrderTest, ManyEqualKeysLeaveTheOrderOfThePassesOnDisk) {
    expectSameAsReference(recordsWithManyTies(3000, 1), "ties");
}

TEST_F(ResultSortOrderTest, MixedCaseAndNonAsciiNamesUnderBothCaseRules) {
    static const char* const kNames[] = {
        "\xC3\xA9t\xC3\xA9",      // été
        "\xC3\x89T\xC3\x89",      // ÉTÉ
        "Stra\xC3\x9F" "e",       // Straße
        "STRASSE",
        "\xC3\x84pfel",           // Äpfel
        "\xC3\xA4pfel",           // äpfel
        "apfel",
        "\xE2\x82\xAC",           // €
        "\xF0\x9F\x98\x80",       // an emoji, four bytes
        "\xED\xA0\x80",           // a lone surrogate, as the writer encodes it
        "Zeta",
        "zeta",
        "\xCE\xA3\xCE\xB9",       // Σι
        "\xCF\x83\xCE\xB9",       // σι
    };
    std::mt19937 random(2);
    std::string content;
    for (uint32_t i = 0; i < 2000; ++i) {
        const char* name = kNames[random() % (sizeof kNames / sizeof kNames[0])];
        std::string path = std::string("/d") + kNames[random() % 4];
        content += record(path, name, random() % 3, i);
    }
    expectSameAsReference(content, "non-ASCII");
}

TEST_F(ResultSortOrderTest, RecordsWithMissingStringsDecideRunsAndAreDropped) {
    std::mt19937 random(3);
    std::string content;
    for (uint32_t i = 0; i < 1500; ++i) {
        int kind = static_cast<int>(random() % 10);
        std::string name = "n" + std::to_string(random() % 20);
        std::string path = "/p" + std::to_string(random() % 5);
        if (kind == 0) {
            content += record(kMissing, name.c_str(), random() % 4, i);
        } else if (kind == 1) {
            content += record(path.c_str(), kMissing, random() % 4, i);
        } else if (kind == 2) {
            content += record(path.c_str(), name.c_str(), random() % 4, i, kMissing);
        } else if (kind == 3) {
            content += record(path.c_str(), name.c_str(), random() % 4, i, "0", kMissing);
        } else {
            content += record(path.c_str(), name.c_str(), random() % 4, i);
        }
    }
    expectSameAsReference(content, "missing strings");
}

TEST_F(ResultSortOrderTest, BytesThatLoadAsOtherTextSortAsTheLoaderReadsThem) {
    // Each loads to characters that save to other bytes: the first pass sees
    // the text as loaded, every later one the text as saved.
    const std::string kOdd[] = {
        std::string("\xC0\xAF", 2),              // overlong "/"
        std::string("\xE0\x80\xAF", 3),          // overlong, three bytes
        std::string("\x80x", 2),                 // stray continuation byte
        std::string("ab\xC3", 3),                // a sequence cut by the end
        std::string("a\0b", 3),                  // NUL inside
        std::string("\xF8\x88\x80\x80\x80", 5),  // five bytes: above 0x10FFFF, saved as "?"
        std::string("\xF4\x90\x80\x80", 4),      // just above 0x10FFFF
        std::string("\xC3\xA9", 2),              // plain é, for company
        std::string("?", 1),
        std::string("A", 1),
    };
    std::mt19937 random(4);
    std::string content;
    for (uint32_t i = 0; i < 1500; ++i) {
        const std::string& name = kOdd[random() % (sizeof kOdd / sizeof kOdd[0])];
        const std::string& path = kOdd[random() % 4];
        content += record("/p" + path, name, random() % 3, i);
    }
    expectSameAsReference(content, "odd bytes");
}

TEST_F(ResultSortOrderTest, CharactersFromTheSignRangeGoToThePassesOnDisk) {
    // 0xFE and 0xFF lead bytes decode to characters with the sign bit set,
    // which have no order-keeping byte form: the sort takes the passes.
    std::mt19937 random(5);
    std::string content;
    for (uint32_t i = 0; i < 300; ++i) {
        std::string name = (i % 7 == 0) ? std::string("\xFE\xBF\xBF\xBF\xBF\xBF\xBF", 7)
                                        : "n" + std::to_string(random() % 30);
        content += record("/p", name, random() % 3, i);
    }
    expectSameAsReference(content, "sign range");
}

TEST_F(ResultSortOrderTest, DamagedTailEndsTheInputAsOnDisk) {
    std::string content = recordsWithManyTies(200, 6);
    std::string cut = record("/p", "last", 1, 9999);
    expectSameAsReference(content + cut.substr(0, cut.size() - 3), "cut record");
    expectSameAsReference(content + std::string("\x7F\xFF\xFF\xF0garbage", 11), "absurd count");
    expectSameAsReference(content + std::string(40, '\0'), "zero padding");
}

TEST_F(ResultSortOrderTest, EmptyOneRecordAndSortedFiles) {
    expectSameAsReference("", "empty");
    expectSameAsReference(record("/p", "only", 1, 0), "one record");
    std::string sorted;
    for (uint32_t i = 0; i < 300; ++i) {
        char name[16];
        std::snprintf(name, sizeof name, "n%05u", i);
        sorted += record("/p", name, i, i);
    }
    expectSameAsReference(sorted, "sorted");
}

TEST_F(ResultSortOrderTest, LongKeysThatShareLongPrefixes) {
    // Keys that agree on hundreds of bytes and differ near their ends, or
    // not at all, and one key above the arena's block size.
    std::string prefix(700, 'p');
    std::mt19937 random(7);
    std::string content;
    for (uint32_t i = 0; i < 400; ++i) {
        std::string path = "/" + prefix + (random() % 2 ? "/q" : "");
        std::string name = prefix + std::to_string(random() % 5);
        content += record(path, name, 7, i);
    }
    content += record("/" + std::string((1 << 20) + 5, 'L'), "big", 1, 400);
    expectSameAsReference(content, "long keys");
}

TEST_F(ResultSortOrderTest, AboveTheLimitTheFileTakesThePassesAndSortsAlike) {
    std::string content = recordsWithManyTies(2000, 8);
    Outcome expected = sortByReference(dir, content, 3, 1, true);
    NaturalMergeReplay::setLimitBytes(static_cast<uint32_t>(content.size() - 1));
    testsupport::TraceCapture capture;
    Outcome got = sortByReader(dir, content, 3, 1, true);
    EXPECT_TRUE(expected.bytes == got.bytes);
    EXPECT_EQ(expected.passes, got.passes);
    NaturalMergeReplay::setLimitBytes(static_cast<uint32_t>(content.size()));
    got = sortByReader(dir, content, 3, 1, true);
    EXPECT_TRUE(expected.bytes == got.bytes);
    EXPECT_EQ(expected.passes, got.passes);
}

TEST_F(ResultSortOrderTest, TheSortTracesItsEntryOnceWhicheverWayItTakes) {
    std::string content = recordsWithManyTies(100, 9);
    for (uint32_t limit : {savedLimit, 0u}) {
        NaturalMergeReplay::setLimitBytes(limit);
        std::string path = dir.write("traced", content);
        testsupport::TraceCapture capture;
        FsResultSetReader_OnFile reader(path.c_str());
        EXPECT_EQ(1, reader.sort(2, 1, true));
        EXPECT_EQ(1u, capture.count("NaturalMergeSort::sort - entering... [" + path + "]")) << capture.dump();
    }
}

TEST_F(ResultSortOrderTest, AnUnwritableDirectoryLeavesTheFileAsItWas) {
    if (::geteuid() == 0) GTEST_SKIP() << "root writes into any directory";
    std::string content = recordsWithManyTies(100, 10);
    std::string sub = dir.mkdirs("locked");
    std::string path = dir.write("locked/file", content);
    ASSERT_EQ(0, ::chmod(sub.c_str(), 0500));
    testsupport::TraceCapture capture;
    FsResultSetReader_OnFile reader(path.c_str());
    EXPECT_EQ(1, reader.sort(2, 1, true));
    ::chmod(sub.c_str(), 0700);
    EXPECT_TRUE(content == testsupport::readFile(path));
    EXPECT_FALSE(testsupport::fileExists(path + ".a"));
}

}  // namespace
