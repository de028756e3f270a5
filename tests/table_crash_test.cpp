// Tables left behind by a killed process, and damaged table files.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>
#include <memory>
#include <string>

#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/table.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

long long diskSize(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) return -1;
    return static_cast<long long>(st.st_size);
}

void overwrite(const std::string& path, size_t offset, const std::string& bytes) {
    FILE* f = fopen(path.c_str(), "r+b");
    ASSERT_NE(nullptr, f);
    fseek(f, static_cast<long>(offset), SEEK_SET);
    fwrite(bytes.data(), 1, bytes.size(), f);
    fclose(f);
}

void truncateTo(const std::string& path, off_t size) { ASSERT_EQ(0, truncate(path.c_str(), size)); }

std::string word(uint32_t v) {
    std::string s;
    codec::putFixed32(&s, v);
    return s;
}

class TableCrashTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
    }
    void TearDown() override { std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore); }

    std::unique_ptr<FS_Table> table(const wchar_t* name, bool compressed = false) {
        return std::unique_ptr<FS_Table>(new FS_Table(name, wdir.c_str(), compressed));
    }
    // A closed table "<name>" with columns n:Int32, s:Text and count records.
    void makeTable(const wchar_t* name, unsigned int count, bool compressed = false) {
        auto t = table(name, compressed);
        t->addField(L"n", FIELD_INT32);
        t->addField(L"s", FIELD_TEXT);
        ASSERT_TRUE(t->create());
        Fields rec(t->getFields());
        for (unsigned int i = 0; i < count; ++i) {
            static_cast<Int32Field*>(rec.at(0))->value(i);
            std::wstring text = L"record " + std::to_wstring(i);
            static_cast<TextField*>(rec.at(1))->value(text.c_str());
            ASSERT_TRUE(t->insert(rec));
        }
        ASSERT_TRUE(t->close());
    }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[1024];
};

// ---- a process killed with the table open ----------------------------------------

void insertAndDie(const std::wstring& wdir, bool compressed, unsigned int count, int readyFd) {
    FS_Table* t = new FS_Table(L"crash", wdir.c_str(), compressed);
    t->addField(L"n", FIELD_INT32);
    t->addField(L"s", FIELD_TEXT);
    if (!t->create()) _exit(2);
    Fields rec(t->getFields());
    for (unsigned int i = 0; i < count; ++i) {
        static_cast<Int32Field*>(rec.at(0))->value(i * 3);
        std::wstring text = L"row-" + std::to_wstring(i);
        static_cast<TextField*>(rec.at(1))->value(text.c_str());
        if (!t->insert(rec)) _exit(3);
    }
    char ok = 1;
    if (write(readyFd, &ok, 1) != 1) _exit(4);
    for (;;) pause();  // killed here, files open and never closed
}

void crashAndReopen(const std::wstring& wdir, const std::string& dirPath, bool compressed) {
    const unsigned int kCount = 500;
    int ready[2];
    ASSERT_EQ(0, pipe(ready));
    pid_t pid = fork();
    ASSERT_NE(-1, pid);
    if (pid == 0) {
        ::close(ready[0]);
        insertAndDie(wdir, compressed, kCount, ready[1]);
    }
    ::close(ready[1]);
    char ok = 0;
    ASSERT_EQ(1, read(ready[0], &ok, 1));
    ::close(ready[0]);
    kill(pid, SIGKILL);
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_TRUE(WIFSIGNALED(status));

    // Both files stay at their allocated size.
    EXPECT_EQ(0x1000000, diskSize(dirPath + "/crash.dat"));
    EXPECT_EQ(0x1000000, diskSize(dirPath + "/crash.pxx"));

    std::unique_ptr<FS_Table> t(new FS_Table(L"crash", wdir.c_str(), compressed));
    ASSERT_TRUE(t->open());
    ASSERT_EQ(2u, t->getFields().count());
    unsigned int stored = 0;
    ASSERT_TRUE(t->count(0, &stored));
    EXPECT_EQ(kCount, stored);

    Fields rec(t->getFields());
    unsigned int id = 0;
    unsigned int seen = 0;
    bool more = t->moveFirst(id);
    while (more) {
        ASSERT_TRUE(t->read(id, rec));
        ASSERT_EQ(seen, id);
        EXPECT_EQ(id * 3, static_cast<Int32Field*>(rec.at(0))->value());
        EXPECT_EQ(L"row-" + std::to_wstring(id), std::wstring(static_cast<TextField*>(rec.at(1))->value()));
        ++seen;
        more = t->moveNext(id);
    }
    // The padding of the pointer file reads as removed slots only.
    EXPECT_EQ(kCount, seen);

    // New records go behind the padding and are found by the walk.
    static_cast<Int32Field*>(rec.at(0))->value(4242);
    static_cast<TextField*>(rec.at(1))->value(L"after crash");
    ASSERT_TRUE(t->insert(rec));
    unsigned int last = 0, index = 0;
    t->moveLast(last, index);
    EXPECT_EQ(0x1000000u / 4, last);
    EXPECT_EQ(kCount, index);
    Fields out(t->getFields());
    ASSERT_TRUE(t->read(last, out));
    EXPECT_EQ(4242u, static_cast<Int32Field*>(out.at(0))->value());
    EXPECT_EQ(std::wstring(L"after crash"), std::wstring(static_cast<TextField*>(out.at(1))->value()));
}

TEST_F(TableCrashTest, PlainTableKilledWithoutCloseReopensAndReadsEveryRecord) {
    crashAndReopen(wdir, dir.path(), false);
}

TEST_F(TableCrashTest, CompressedTableKilledWithoutCloseReopensAndReadsEveryRecord) {
    crashAndReopen(wdir, dir.path(), true);
}

// ---- truncated and missing files --------------------------------------------------

TEST_F(TableCrashTest, MissingDataFileMakesOpenFail) {
    makeTable(L"m1", 3);
    ASSERT_EQ(0, unlink(dir.file("m1.dat").c_str()));
    auto t = table(L"m1");
    EXPECT_FALSE(t->open());
    EXPECT_EQ(nullptr, t->getDataFile());
    EXPECT_EQ(nullptr, t->getPointerFile());
}

TEST_F(TableCrashTest, MissingPointerFileMakesOpenFail) {
    makeTable(L"m2", 3);
    ASSERT_EQ(0, unlink(dir.file("m2.pxx").c_str()));
    auto t = table(L"m2");
    EXPECT_FALSE(t->open());
    EXPECT_EQ(0u, t->getFields().count());
}

TEST_F(TableCrashTest, EmptyOrShortHeaderMakesOpenFail) {
    makeTable(L"h0", 1);
    truncateTo(dir.file("h0.dat"), 0);
    EXPECT_FALSE(table(L"h0")->open());
    makeTable(L"h1", 1);
    truncateTo(dir.file("h1.dat"), 10);
    EXPECT_FALSE(table(L"h1")->open());
    makeTable(L"h2", 1);
    truncateTo(dir.file("h2.dat"), 12 + 12 + 6);  // inside the second descriptor
    auto t = table(L"h2");
    EXPECT_FALSE(t->open());
    EXPECT_EQ(0u, t->getFields().count());
}

TEST_F(TableCrashTest, FieldCountPastTheEndMakesOpenFail) {
    makeTable(L"fc", 1);
    overwrite(dir.file("fc.dat"), 8, word(0xFFFFFFFFu));
    EXPECT_FALSE(table(L"fc")->open());
    overwrite(dir.file("fc.dat"), 8, word(200));
    EXPECT_FALSE(table(L"fc")->open());
}

TEST_F(TableCrashTest, NameLengthPastTheEndOrNotWholeCharactersMakesOpenFail) {
    makeTable(L"nl", 1);
    overwrite(dir.file("nl.dat"), 16, word(0x7FFFFFF0u));
    EXPECT_FALSE(table(L"nl")->open());
    overwrite(dir.file("nl.dat"), 16, word(5));
    EXPECT_FALSE(table(L"nl")->open());
}

TEST_F(TableCrashTest, SlotPointingPastTheDataFileStopsTheReader) {
    makeTable(L"sl", 2);
    overwrite(dir.file("sl.pxx"), 4, word(0x00FFFFFFu));
    auto t = table(L"sl");
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    EXPECT_TRUE(t->read(0, rec));
    EXPECT_FALSE(t->read(1, rec));
    EXPECT_FALSE(t->read(2, rec));        // no such slot
    EXPECT_FALSE(t->read(0x40000000u, rec));
}

TEST_F(TableCrashTest, SlotPointingAtTheLastBytesStopsTheReaderInsideTheRecord) {
    makeTable(L"tail", 1);
    long long size = diskSize(dir.file("tail.dat"));
    overwrite(dir.file("tail.pxx"), 0, word(static_cast<uint32_t>(size - 2)));
    auto t = table(L"tail");
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    EXPECT_FALSE(t->read(0, rec));
}

TEST_F(TableCrashTest, TextLengthPastTheEndStopsTheReader) {
    makeTable(L"tl", 1);
    auto probe = table(L"tl");
    ASSERT_TRUE(probe->open());
    unsigned int header = probe->headerSize();
    probe.reset();
    // Record: bitmap (1), n (4), then the 2-byte text length.
    overwrite(dir.file("tl.dat"), header + 5, std::string("\xFF\xFF", 2));
    auto t = table(L"tl");
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    EXPECT_FALSE(t->read(0, rec));
    EXPECT_EQ(0u, static_cast<Int32Field*>(rec.at(0))->value());
}

TEST_F(TableCrashTest, CompressedIntegerThatNeverEndsStopsTheReader) {
    makeTable(L"ci", 1, true);
    auto probe = table(L"ci", true);
    ASSERT_TRUE(probe->open());
    unsigned int header = probe->headerSize();
    probe.reset();
    // Every byte from the value of n onward says "another byte follows".
    long long size = diskSize(dir.file("ci.dat"));
    overwrite(dir.file("ci.dat"), header + 1, std::string(static_cast<size_t>(size - header - 1), '\x01'));
    auto t = table(L"ci", true);
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    EXPECT_FALSE(t->read(0, rec));
}

TEST_F(TableCrashTest, TruncatedPointerFileEndsTheWalkAtTheLastWholeSlot) {
    makeTable(L"tp", 3);
    truncateTo(dir.file("tp.pxx"), 10);
    auto t = table(L"tp");
    ASSERT_TRUE(t->open());
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    ASSERT_TRUE(t->moveNext(id));
    EXPECT_EQ(1u, id);
    EXPECT_FALSE(t->moveNext(id));
    EXPECT_EQ(1u, id);
}

TEST_F(TableCrashTest, OpeningWithTheWrongCompressionFlagNeverReadsOutOfBounds) {
    makeTable(L"wf", 4, false);
    auto t = table(L"wf", true);
    ASSERT_TRUE(t->open());
    Fields rec(t->getFields());
    unsigned int id = 0;
    unsigned int visited = 0;
    bool more = t->moveFirst(id);
    while (more) {
        t->read(id, rec);  // values are wrong, but the read stays in the file
        ++visited;
        more = t->moveNext(id);
    }
    EXPECT_EQ(4u, visited);
}

}  // namespace
