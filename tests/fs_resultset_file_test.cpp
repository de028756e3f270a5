// Result set on a temporary file: names, writer, reader, bookmarks, sorting,
// and who removes the file.
#include "fscanner/fs/fs_resultset_file.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <random>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_loader.h"
#include "support/testsupport.h"

namespace {

using testsupport::fileExists;
using testsupport::readFile;

char* noTempName(char*) {
    return nullptr;
}

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

long fileSize(const std::string& path) {
    struct stat st;
    if (::stat(path.c_str(), &st) != 0) return -1;
    return static_cast<long>(st.st_size);
}

// Every test starts and ends with the ordinary name sources.
class ResultSetOnFileTest : public ::testing::Test {
protected:
    void SetUp() override { FsResultSet_OnFile::resetTempNameSources(); }
    void TearDown() override { FsResultSet_OnFile::resetTempNameSources(); }
    // Names under the test's own directory: "<dir>/fsq_<n>".
    void useFallbackIn(const testsupport::TempDir& d) {
        prefix = d.path() + "/";
        FsResultSet_OnFile::setTempNameSources(noTempName, prefix.c_str(), "/nonexistent-dir/");
    }
    // For the large sorts: names on a memory file system when the machine
    // has one, so that the syncs of the mapped files cost nothing; otherwise
    // the test's own directory.
    void useFastDirectory() {
        char pattern[] = "/dev/shm/fsq-test-XXXXXX";
        if (::access("/dev/shm", W_OK) == 0 && ::mkdtemp(pattern) != nullptr) {
            fastDir = pattern;
            prefix = fastDir + "/";
            FsResultSet_OnFile::setTempNameSources(noTempName, prefix.c_str(), "/nonexistent-dir/");
        } else {
            useFallbackIn(dir);
        }
    }
    ~ResultSetOnFileTest() override {
        if (!fastDir.empty()) testsupport::removeTree(fastDir);
    }
    std::string prefix;
    std::string fastDir;
    testsupport::TempDir dir;
};

void addPlain(FsResultSetWriter* writer, const wchar_t* path, const wchar_t* name,
              unsigned long long size) {
    ASSERT_EQ(0, writer->addRecord(path, name, size, 0x2000, L"0", 0, 0));
}

std::vector<std::wstring> readNames(FsResultSetReader* reader) {
    std::vector<std::wstring> names;
    FsFileInfo info;
    while (reader->getNext(info) == 1) names.push_back(info.getName());
    return names;
}

// ---- temporary names --------------------------------------------------------

TEST_F(ResultSetOnFileTest, TmpnamNameIsUsedAndNothingIsCreatedYet) {
    testsupport::TraceCapture capture;
    FsResultSet_OnFile set;
    ASSERT_NE(nullptr, set.getFileName());
    std::string name = set.getFileName();
    EXPECT_FALSE(fileExists(name));
    EXPECT_TRUE(capture.contains("The temp file name is: " + name)) << capture.dump();
    EXPECT_TRUE(capture.contains("name ok: " + name)) << capture.dump();
}

TEST_F(ResultSetOnFileTest, FallbackCreatesFsqZeroInTheFirstDirectory) {
    useFallbackIn(dir);
    FsResultSet_OnFile set;
    EXPECT_EQ(dir.path() + "/fsq_0", std::string(set.getFileName()));
    EXPECT_TRUE(fileExists(dir.file("fsq_0")));
    EXPECT_EQ("", readFile(dir.file("fsq_0")));
}

TEST_F(ResultSetOnFileTest, FallbackSkipsNamesThatExist) {
    dir.write("fsq_0", "taken");
    dir.write("fsq_1", "taken");
    useFallbackIn(dir);
    FsResultSet_OnFile set;
    EXPECT_EQ(dir.path() + "/fsq_2", std::string(set.getFileName()));
    EXPECT_EQ("taken", readFile(dir.file("fsq_0")));
}

TEST_F(ResultSetOnFileTest, FallbackGoesToTheSecondDirectoryWhenTheFirstFails) {
    testsupport::TempDir second;
    std::string secondPrefix = second.path() + "/";
    FsResultSet_OnFile::setTempNameSources(noTempName, "/nonexistent-dir/", secondPrefix.c_str());
    FsResultSet_OnFile set;
    EXPECT_EQ(second.path() + "/fsq_0", std::string(set.getFileName()));
}

TEST_F(ResultSetOnFileTest, NoTempNameAtAllEndsTheProcessWithCode41) {
    EXPECT_EXIT(
        {
            getQvLogFs()->configure(1, nullptr);
            FsResultSet_OnFile::setTempNameSources(noTempName, "/nonexistent-dir/",
                                                   "/nonexistent-dir-2/");
            FsResultSet_OnFile set;
        },
        ::testing::ExitedWithCode(41), "Exiting due to null temp file name: ");
}

// ---- writer and reader ------------------------------------------------------

TEST_F(ResultSetOnFileTest, WrittenRecordsComeBackInOrder) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    FsFileInfo full;
    full.setFilePath(L"/data");
    full.setFileName(L"b\u00e9");
    full.setMD5(L"d41d8cd98f00b204e9800998ecf8427e");
    full.setSHA256(L"e3b0");
    full.setFileSize(1ull << 40);
    full.setLastModifyTime(1700000000L);
    EXPECT_EQ(0, writer->addRecord(full));
    EXPECT_EQ(0, writer->addRecord(L"/x", L"y", 5, 0x2000, L"abc", 0x11, 0x22));

    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_STREQ(L"/data", info.getPath());
    EXPECT_STREQ(L"b\u00e9", info.getName());
    EXPECT_STREQ(L"d41d8cd98f00b204e9800998ecf8427e", info.getMD5());
    EXPECT_STREQ(L"e3b0", info.getSHA256());
    EXPECT_EQ(1ull << 40, info.getSize());
    EXPECT_EQ(1700000000L, info.getLastModifyTime());
    EXPECT_EQ(0x102u, info.getValidMask());

    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_STREQ(L"/x", info.getPath());
    EXPECT_STREQ(L"y", info.getName());
    EXPECT_STREQ(L"abc", info.getMD5());
    EXPECT_STREQ(L"0", info.getSHA256());
    EXPECT_EQ(0xC03u, info.getValidMask());
    EXPECT_EQ(5u, info.getSize());
    EXPECT_EQ(0x2000u, info.getAttr());
    EXPECT_EQ(0x11u, info.getCRC32());
    EXPECT_EQ(0x22u, info.getQ32());

    EXPECT_EQ(0, reader->getNext(info));
    delete reader;
}

TEST_F(ResultSetOnFileTest, ClosedWriterCutsTheFileToItsBigEndianContent) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    EXPECT_EQ(0, writer->addRecord(L"/", L"a", 0x0102, 0x2000, L"0", 0xA1B2C3D4, 7));
    EXPECT_EQ(0, writer->close());
    EXPECT_EQ("00 00 00 02 2F "
              "00 00 00 02 61 "
              "00 00 00 02 30 "
              "00 00 00 02 30 "
              "00 00 0C 03 "
              "00 00 20 00 "
              "00 00 00 00 00 00 01 02 "
              "A1 B2 C3 D4 "
              "00 00 00 07",
              hex(readFile(set.getFileName())));
}

TEST_F(ResultSetOnFileTest, WriterAnswersMinusOneAfterClose) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    EXPECT_EQ(0, writer->close());
    EXPECT_EQ(-1, writer->addRecord(L"/", L"a", 1, 0, L"0", 0, 0));
    FsFileInfo info;
    info.setFilePath(L"/");
    info.setFileName(L"a");
    EXPECT_EQ(-1, writer->addRecord(info));
    EXPECT_EQ(0, writer->close());
}

TEST_F(ResultSetOnFileTest, RecordWithoutNameIsRefusedAndNothingIsWritten) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    FsFileInfo nameless;
    nameless.setFilePath(L"/p");
    EXPECT_EQ(-1, writer->addRecord(nameless));
    writer->close();
    EXPECT_EQ(0, fileSize(set.getFileName()));
}

TEST_F(ResultSetOnFileTest, GetWriterAndGetReaderGiveTheSameObjectsAndTrace) {
    testsupport::TraceCapture capture;
    FsResultSet_OnFile set;
    std::string name = set.getFileName();
    FsResultSetWriter* writer = set.getWriter();
    EXPECT_EQ(writer, set.getWriter());
    addPlain(writer, L"/", L"a", 1);
    FsResultSetReader* reader = set.getReader();
    EXPECT_EQ(reader, set.getReader());
    // The first getReader closed the writer.
    EXPECT_EQ(-1, writer->addRecord(L"/", L"b", 1, 0, L"0", 0, 0));
    EXPECT_EQ(2u, capture.count("FsResultSet_OnFile - getWriter for file: '" + name + "'"));
    EXPECT_EQ(2u, capture.count("FsResultSet_OnFile - getReader for file: '" + name + "'"));
    delete reader;
}

TEST_F(ResultSetOnFileTest, ReaderWithoutWriterMeetsAnEmptyEnd) {
    useFallbackIn(dir);  // the fallback creates the empty file
    FsResultSet_OnFile set;
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    FsFileInfo info;
    EXPECT_EQ(0, reader->getNext(info));
    delete reader;
}

TEST_F(ResultSetOnFileTest, GetNextBeforeMoveFirstReturnsZero) {
    FsResultSet_OnFile set;
    addPlain(set.getWriter(), L"/", L"a", 1);
    FsResultSetReader* reader = set.getReader();
    FsFileInfo info;
    info.setFileName(L"untouched");
    EXPECT_EQ(0, reader->getNext(info));
    EXPECT_STREQ(L"untouched", info.getName());
    EXPECT_EQ(0, reader->setBookmark());
    EXPECT_EQ(0, reader->toBookmark());
    reader->moveFirst();
    EXPECT_EQ(1, reader->getNext(info));
    delete reader;
}

TEST_F(ResultSetOnFileTest, EndOfFileStaysUntilToBookmarkMakesReadingWorkAgain) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    addPlain(writer, L"/", L"one", 1);
    addPlain(writer, L"/", L"two", 2);
    addPlain(writer, L"/", L"three", 3);
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_EQ(1, reader->setBookmark());
    ASSERT_EQ(1, reader->getNext(info));
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_EQ(0, reader->getNext(info));
    EXPECT_EQ(0, reader->getNext(info));  // the end error stays stored
    EXPECT_EQ(1, reader->toBookmark());
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_STREQ(L"two", info.getName());
    reader->moveFirst();
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_STREQ(L"one", info.getName());
    delete reader;
}

TEST_F(ResultSetOnFileTest, MoveFirstForgetsTheEndError) {
    FsResultSet_OnFile set;
    addPlain(set.getWriter(), L"/", L"only", 1);
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"only"}), readNames(reader));
    reader->moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"only"}), readNames(reader));
    delete reader;
}

// ---- who removes the file ---------------------------------------------------

TEST_F(ResultSetOnFileTest, SetDeletedWithoutReaderUnlinksTheFile) {
    std::string name;
    {
        FsResultSet_OnFile set;
        name = set.getFileName();
        addPlain(set.getWriter(), L"/", L"a", 1);
        EXPECT_TRUE(fileExists(name));
    }
    EXPECT_FALSE(fileExists(name));
}

TEST_F(ResultSetOnFileTest, WithAReaderTheFileStandsUntilTheReaderIsDeleted) {
    FsResultSet_OnFile* set = new FsResultSet_OnFile();
    std::string name = set->getFileName();
    addPlain(set->getWriter(), L"/", L"kept", 1);
    FsResultSetReader* reader = set->getReader();
    delete set;
    EXPECT_TRUE(fileExists(name));
    reader->moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"kept"}), readNames(reader));
    delete reader;
    EXPECT_FALSE(fileExists(name));
}

TEST_F(ResultSetOnFileTest, WriterDestructorLeavesTheFileOnDisk) {
    std::string name = dir.file("written");
    FsResultSetWriter_OnFile* writer = new FsResultSetWriter_OnFile(name.c_str());
    addPlain(writer, L"/", L"a", 1);
    delete writer;
    EXPECT_EQ(44, fileSize(name));
}

TEST_F(ResultSetOnFileTest, ReaderDestructorUnlinksItsFile) {
    std::string name = dir.write("somefile", "");
    FsResultSetReader_OnFile* reader = new FsResultSetReader_OnFile(name.c_str());
    delete reader;
    EXPECT_FALSE(fileExists(name));
}

TEST_F(ResultSetOnFileTest, ReaderWithNullNameIsFatal) {
    EXPECT_DEATH({ FsResultSetReader_OnFile reader(nullptr); }, "filename != 0");
}

TEST_F(ResultSetOnFileTest, CleanupHandlerWithCodeZeroDoesNothing) {
    std::string name = dir.write("victim", "x");
    deleteFile_CleanupHandler(0, &name[0]);
    EXPECT_TRUE(fileExists(name));
}

TEST_F(ResultSetOnFileTest, CleanupHandlerTracesAndUnlinks) {
    testsupport::TraceCapture capture;
    std::string name = dir.write("victim", "x");
    deleteFile_CleanupHandler(3, &name[0]);
    EXPECT_FALSE(fileExists(name));
    EXPECT_TRUE(capture.contains("Cleanup handler invoked (code: 3), deleting temp file: " + name))
        << capture.dump();
}

TEST_F(ResultSetOnFileTest, LiveSetRegistersItsFileForProcessCleanup) {
    FsResultSet_OnFile set;
    std::string name = set.getFileName();
    addPlain(set.getWriter(), L"/", L"a", 1);
    set.getWriter()->close();
    ASSERT_TRUE(fileExists(name));
    FsResourceManager::getInstance()->invokeCleanupHandlers(0);
    EXPECT_TRUE(fileExists(name));
    FsResourceManager::getInstance()->invokeCleanupHandlers(9);
    EXPECT_FALSE(fileExists(name));
}

TEST_F(ResultSetOnFileTest, DeletedSetLeavesNoHandlerBehindOnItsFreedName) {
    std::string name;
    {
        FsResultSet_OnFile set;
        name = set.getFileName();
    }
    // A file that now happens to carry the old name is not the set's business.
    testsupport::TempDir other;
    std::string replacement = other.write("f", "y");
    ASSERT_EQ(0, std::rename(replacement.c_str(), name.c_str()));
    FsResourceManager::getInstance()->invokeCleanupHandlers(9);
    EXPECT_TRUE(fileExists(name));
    ::unlink(name.c_str());
}

// ---- damaged files ----------------------------------------------------------

TEST_F(ResultSetOnFileTest, AbsurdStringCountStopsTheReaderCleanly) {
    std::string name = dir.file("damaged");
    {
        FsResultSetWriter_OnFile writer(name.c_str());
        addPlain(&writer, L"/", L"good", 1);
    }
    std::string bytes = readFile(name);
    bytes += std::string("\x7F\xFF\xFF\xF0", 4) + "garbage";
    dir.write("damaged", bytes);
    FsResultSetReader_OnFile reader(name.c_str());
    reader.moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"good"}), readNames(&reader));
}

TEST_F(ResultSetOnFileTest, TruncatedRecordEndsReadingAtItsStart) {
    std::string name = dir.file("cut");
    {
        FsResultSetWriter_OnFile writer(name.c_str());
        addPlain(&writer, L"/", L"first", 1);
        addPlain(&writer, L"/", L"second", 2);
    }
    std::string bytes = readFile(name);
    dir.write("cut", bytes.substr(0, bytes.size() - 3));
    FsResultSetReader_OnFile reader(name.c_str());
    reader.moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"first"}), readNames(&reader));
}

TEST_F(ResultSetOnFileTest, SortOfADamagedFileEndsAndKeepsTheGoodRecords) {
    std::string name = dir.file("damaged-sort");
    {
        FsResultSetWriter_OnFile writer(name.c_str());
        addPlain(&writer, L"/", L"c", 1);
        addPlain(&writer, L"/", L"a", 2);
        addPlain(&writer, L"/", L"b", 3);
    }
    std::string bytes = readFile(name);
    dir.write("damaged-sort", bytes + std::string("\xFF\xFF\xFF\xFF\x01", 5));
    FsResultSetReader_OnFile reader(name.c_str());
    EXPECT_EQ(1, reader.sort(2, 1, true));
    reader.moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"a", L"b", L"c"}), readNames(&reader));
}

// ---- sorting ----------------------------------------------------------------

TEST_F(ResultSetOnFileTest, SortWithKeyFiveReturnsZeroAndReadingGoesOn) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    addPlain(writer, L"/", L"b", 1);
    addPlain(writer, L"/", L"a", 2);
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    FsFileInfo info;
    ASSERT_EQ(1, reader->getNext(info));
    testsupport::TraceCapture capture;
    EXPECT_EQ(0, reader->sort(5, 1, true));
    EXPECT_TRUE(capture.contains("FsResultSetReader_OnFile::sort - entering..."));
    EXPECT_TRUE(capture.contains("FsResultSetReader_OnFile::sort - exiting..."));
    EXPECT_FALSE(capture.contains("naturalMergeSort object created"));
    ASSERT_EQ(1, reader->getNext(info));
    EXPECT_STREQ(L"a", info.getName());
    delete reader;
}

TEST_F(ResultSetOnFileTest, SortWithOrderThreeReturnsOneLeavesTheFileAndNeedsMoveFirst) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    addPlain(writer, L"/", L"b", 1);
    addPlain(writer, L"/", L"c", 2);
    addPlain(writer, L"/", L"a", 3);
    FsResultSetReader* reader = set.getReader();
    std::string before = readFile(set.getFileName());
    reader->moveFirst();
    EXPECT_EQ(1, reader->sort(2, 3, true));
    EXPECT_EQ(before, readFile(set.getFileName()));
    FsFileInfo info;
    EXPECT_EQ(0, reader->getNext(info));
    reader->moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"b", L"c", L"a"}), readNames(reader));
    delete reader;
}

TEST_F(ResultSetOnFileTest, SortTracesItsMilestonesAndClosesTheReader) {
    FsResultSet_OnFile set;
    std::string name = set.getFileName();
    FsResultSetWriter* writer = set.getWriter();
    addPlain(writer, L"/", L"b", 1);
    addPlain(writer, L"/", L"a", 2);
    FsResultSetReader* reader = set.getReader();
    reader->moveFirst();
    testsupport::TraceCapture capture;
    EXPECT_EQ(1, reader->sort(2, 1, true));
    const char* expected[] = {
        "FsResultSetReader_OnFile::sort - entering...",
        "FsResultSetReader_OnFile::sort - file name is ",
        "FsResultSetReader_OnFile::sort - naturalMergeSort object created!",
        "NaturalMergeSort::sort - entering... [",
        "FsResultSetReader_OnFile::sort - file sorted!",
        "FsResultSetReader_OnFile::sort - exiting...",
    };
    size_t last = 0;
    std::vector<QvLogWrapper::Message> messages = capture.messages();
    for (const char* text : expected) {
        size_t at = last;
        while (at < messages.size() && messages[at].text.find(text) == std::string::npos) ++at;
        ASSERT_LT(at, messages.size()) << "missing or out of order: " << text << "\n"
                                       << capture.dump();
        last = at + 1;
    }
    EXPECT_TRUE(capture.contains("FsResultSetReader_OnFile::sort - file name is " + name));
    FsFileInfo info;
    EXPECT_EQ(0, reader->getNext(info));
    reader->moveFirst();
    EXPECT_EQ((std::vector<std::wstring>{L"a", L"b"}), readNames(reader));
    EXPECT_FALSE(fileExists(name + ".a"));
    EXPECT_FALSE(fileExists(name + ".b"));
    delete reader;
}

TEST_F(ResultSetOnFileTest, CaseFlagReachesTheComparison) {
    for (int flag = 0; flag <= 1; ++flag) {
        FsResultSet_OnFile set;
        FsResultSetWriter* writer = set.getWriter();
        addPlain(writer, L"/", L"B", 1);
        addPlain(writer, L"/", L"a", 2);
        addPlain(writer, L"/", L"C", 3);
        FsResultSetReader* reader = set.getReader();
        EXPECT_EQ(1, reader->sort(2, 1, flag == 1));
        reader->moveFirst();
        if (flag == 1) {
            EXPECT_EQ((std::vector<std::wstring>{L"B", L"C", L"a"}), readNames(reader));
        } else {
            EXPECT_EQ((std::vector<std::wstring>{L"a", L"B", L"C"}), readNames(reader));
        }
        delete reader;
    }
}

TEST_F(ResultSetOnFileTest, RecordsAlreadyInOrderSortInOnePass) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    for (int i = 0; i < 500; ++i) addPlain(writer, L"/", L"n", static_cast<unsigned long long>(i));
    FsResultSetReader* reader = set.getReader();
    std::string before = readFile(set.getFileName());
    testsupport::TraceCapture capture;
    EXPECT_EQ(1, reader->sort(4, 1, true));
    EXPECT_EQ(1u, capture.count("NaturalMergeSort::sort - pass ")) << capture.dump();
    EXPECT_TRUE(capture.contains("NaturalMergeSort::sort - pass 1 merged 1 runs"));
    EXPECT_EQ(before, readFile(set.getFileName()));
    delete reader;
}

// Records whose path, name and size are each unique, so that every key gives
// one strict order and the comparison with the library sort is exact.
std::vector<FsFileInfo> uniqueRecords(size_t count, unsigned int seed) {
    std::mt19937 random(seed);
    std::vector<unsigned int> a(count), b(count), c(count);
    for (size_t i = 0; i < count; ++i) a[i] = b[i] = c[i] = static_cast<unsigned int>(i);
    std::shuffle(a.begin(), a.end(), random);
    std::shuffle(b.begin(), b.end(), random);
    std::shuffle(c.begin(), c.end(), random);
    std::vector<FsFileInfo> records(count);
    for (size_t i = 0; i < count; ++i) {
        std::wstring path = L"/dir" + std::to_wstring(a[i]);
        std::wstring name = L"file" + std::to_wstring(b[i]) + L".txt";
        records[i].setFilePath(path.c_str());
        records[i].setFileName(name.c_str());
        records[i].setFileSize(static_cast<unsigned long long>(c[i]) * 7 + 3);
        records[i].setCRC32(static_cast<unsigned int>(i));
    }
    return records;
}

// The order std::stable_sort gives with FsFileInfo::compare as the relation.
std::vector<unsigned int> referenceOrder(std::vector<FsFileInfo>& records, int key,
                                         unsigned int order, bool flag) {
    std::vector<FsFileInfo*> pointers;
    for (FsFileInfo& r : records) pointers.push_back(&r);
    unsigned int op = order == 1 ? 4u : 3u;  // less, greater
    std::stable_sort(pointers.begin(), pointers.end(), [&](FsFileInfo* x, FsFileInfo* y) {
        return x->compare(*y, key, op, flag);
    });
    std::vector<unsigned int> ids;
    for (FsFileInfo* p : pointers) ids.push_back(p->getCRC32());
    return ids;
}

std::vector<unsigned int> sortedThroughTheSet(const std::vector<FsFileInfo>& records, int key,
                                              unsigned int order, bool flag) {
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    for (const FsFileInfo& r : records) EXPECT_EQ(0, writer->addRecord(r));
    FsResultSetReader* reader = set.getReader();
    EXPECT_EQ(1, reader->sort(static_cast<unsigned int>(key), order, flag));
    reader->moveFirst();
    std::vector<unsigned int> ids;
    FsFileInfo info;
    while (reader->getNext(info) == 1) ids.push_back(info.getCRC32());
    delete reader;
    return ids;
}

TEST_F(ResultSetOnFileTest, EveryKeyInBothOrdersMatchesStableSort) {
    useFastDirectory();
    std::vector<FsFileInfo> records = uniqueRecords(3000, 7);
    for (int key = 1; key <= 4; ++key) {
        for (unsigned int order = 1; order <= 2; ++order) {
            std::vector<unsigned int> expected = referenceOrder(records, key, order, true);
            EXPECT_EQ(expected, sortedThroughTheSet(records, key, order, true))
                << "key " << key << " order " << order;
        }
    }
}

TEST_F(ResultSetOnFileTest, TwoHundredThousandRecordsMatchStableSort) {
    useFastDirectory();
    std::vector<FsFileInfo> records = uniqueRecords(200000, 11);
    std::vector<unsigned int> expected = referenceOrder(records, 3, 1, true);
    auto start = std::chrono::steady_clock::now();
    std::vector<unsigned int> got = sortedThroughTheSet(records, 3, 1, true);
    auto seconds =
        std::chrono::duration_cast<std::chrono::seconds>(std::chrono::steady_clock::now() - start);
    ASSERT_EQ(expected.size(), got.size());
    EXPECT_TRUE(expected == got);
    std::printf("200000 records written, sorted and read in %lld s\n",
                static_cast<long long>(seconds.count()));
}

// The instrumented build sorts about twenty times slower; there the same
// check runs over fewer records, and the full count runs in the plain build.
#if defined(__SANITIZE_ADDRESS__)
const size_t kEveryKeyRecords = 10000;
#else
const size_t kEveryKeyRecords = 200000;
#endif

TEST_F(ResultSetOnFileTest, EveryKeyInBothOrdersOfTwoHundredThousandRecordsMatchesStableSort) {
    useFastDirectory();
    std::vector<FsFileInfo> records = uniqueRecords(kEveryKeyRecords, 13);
    FsResultSet_OnFile set;
    FsResultSetWriter* writer = set.getWriter();
    for (const FsFileInfo& r : records) ASSERT_EQ(0, writer->addRecord(r));
    FsResultSetReader* reader = set.getReader();
    // Every key is unique, so each order is one strict order whatever the
    // file held before: the one file is sorted again and again.
    for (int key = 1; key <= 4; ++key) {
        for (unsigned int order = 1; order <= 2; ++order) {
            std::vector<unsigned int> expected = referenceOrder(records, key, order, true);
            ASSERT_EQ(1, reader->sort(static_cast<unsigned int>(key), order, true));
            reader->moveFirst();
            std::vector<unsigned int> got;
            got.reserve(records.size());
            FsFileInfo info;
            while (reader->getNext(info) == 1) got.push_back(info.getCRC32());
            ASSERT_EQ(expected.size(), got.size()) << "key " << key << " order " << order;
            EXPECT_TRUE(expected == got) << "key " << key << " order " << order;
            EXPECT_FALSE(fileExists(set.getFileName() + std::string(".a")));
            EXPECT_FALSE(fileExists(set.getFileName() + std::string(".b")));
        }
    }
    delete reader;
}

TEST_F(ResultSetOnFileTest, EqualKeysComeOutInKeyOrderWithNothingLost) {
    // Many equal sizes: the order of keys is that of the library sort, and
    // every record is there once.  (Equal keys may leave their input order
    // where runs join inside a scratch file; see the merge sort's tests.)
    useFastDirectory();
    std::vector<FsFileInfo> records = uniqueRecords(5000, 3);
    std::mt19937 random(5);
    for (FsFileInfo& r : records) r.setFileSize(random() % 50);
    for (unsigned int order = 1; order <= 2; ++order) {
        std::vector<unsigned int> ids = sortedThroughTheSet(records, 4, order, true);
        ASSERT_EQ(records.size(), ids.size());
        std::vector<unsigned long long> sizes;
        for (unsigned int id : ids) sizes.push_back(records[id].getSize());
        if (order == 1) {
            EXPECT_TRUE(std::is_sorted(sizes.begin(), sizes.end()));
        } else {
            EXPECT_TRUE(std::is_sorted(sizes.rbegin(), sizes.rend()));
        }
        std::sort(ids.begin(), ids.end());
        for (size_t i = 0; i < ids.size(); ++i) ASSERT_EQ(i, ids[i]);
    }
}

}  // namespace
