// Damaged cache files, one reproduction each: a damaged cache never crashes
// the query and never answers wrong in silence.  It answers -40, close()
// removes it, and the next query builds it anew and answers right.  Every
// query runs in a forked child, so that a crash is a failed expectation and
// not the end of the suite.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <set>
#include <string>
#include <vector>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/table.h"
#include "support/cachefixture.h"

using testsupport::HitWriter;
using testsupport::widen;

namespace {

const unsigned int LONG_AGE = 3600 * 24;

// How a forked query ended: the child's result and hits, or the signal that
// killed it (0 when it exited).
struct Outcome {
    int signal = 0;
    int rc = 0;
    std::multiset<std::string> hits;
};

// Runs one recursive query over root on the cache in cacheDir in a child
// process (FS_CACHE_OPEN_ALWAYS, create, query, close), as a caller does.
Outcome runQuery(const std::string& cacheDir, const std::string& root, const std::wstring& text)
{
    int fds[2];
    Outcome out;
    if (pipe(fds) != 0) {
        out.signal = -1;
        return out;
    }
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        close(fds[0]);
        alarm(60);
        std::string report;
        FsGlue glue = testsupport::plainGlue();
        FS_Cache cache(L"directories", L"files", widen(cacheDir).c_str(), false, true, &glue,
                       L"prov");
        int rc = cache.create(0, FS_CACHE_OPEN_ALWAYS);
        std::vector<std::string> hits;
        if (rc == 0) {
            FsQuery q;
            q.setQuery(text.c_str());
            q.addIncludePath(widen(root).c_str(), true);
            struct ListWriter : HitWriter {
                std::vector<std::string>* all;
                int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                              unsigned int attr, const wchar_t* md5, unsigned int crc,
                              unsigned int q32) override {
                    all->push_back(testsupport::joinPath(testsupport::bytesOf(path),
                                                         testsupport::bytesOf(name)));
                    return HitWriter::addRecord(path, name, size, attr, md5, crc, q32);
                }
            } writer;
            writer.all = &hits;
            rc = cache.executeQueryEx(writer, q, 600000, LONG_AGE);
            cache.close();
        }
        report = std::to_string(rc) + "\n";
        for (auto const& h : hits)
            report += h + "\n";
        size_t done = 0;
        while (done < report.size()) {
            ssize_t n = write(fds[1], report.data() + done, report.size() - done);
            if (n <= 0)
                break;
            done += static_cast<size_t>(n);
        }
        _exit(0);
    }
    close(fds[1]);
    std::string got;
    char buffer[4096];
    for (;;) {
        ssize_t n = read(fds[0], buffer, sizeof buffer);
        if (n <= 0)
            break;
        got.append(buffer, static_cast<size_t>(n));
    }
    close(fds[0]);
    int status = 0;
    waitpid(pid, &status, 0);
    if (WIFSIGNALED(status)) {
        out.signal = WTERMSIG(status);
        return out;
    }
    size_t line = got.find('\n');
    out.rc = line == std::string::npos ? -1000 : std::stoi(got.substr(0, line));
    while (line != std::string::npos && line + 1 < got.size()) {
        size_t end = got.find('\n', line + 1);
        out.hits.insert(got.substr(line + 1, end - line - 1));
        line = end;
    }
    return out;
}

void overwrite(const std::string& path, size_t offset, const std::string& bytes)
{
    FILE* f = fopen(path.c_str(), "r+b");
    ASSERT_NE(nullptr, f) << path;
    fseek(f, static_cast<long>(offset), SEEK_SET);
    fwrite(bytes.data(), 1, bytes.size(), f);
    fclose(f);
}

struct DamagedCacheTest : ::testing::Test {
    testsupport::MachineFixture machine;
    testsupport::TempDir tree;
    testsupport::TempDir cache;
    std::string root;
    std::multiset<std::string> expected;

    DamagedCacheTest() {
        root = tree.path();
        while (root.size() > 1 && root.back() == '/')
            root.pop_back();
        for (int d = 0; d < 4; ++d) {
            std::string dir = "dir" + std::to_string(d) + (d == 3 ? "/inner" : "");
            for (int f = 0; f < 6; ++f)
                tree.write(dir + "/file" + std::to_string(f) + ".txt", std::string(f * 3, 'x'));
        }
        tree.write("dir1/alphabet_soup.txt", "abc");
        for (auto const& f : testsupport::findFiles(root))
            expected.insert(f);
    }

    std::string cacheFile(const std::string& name) const { return cache.file(name); }

    // Builds the cache and checks that it answers whole.
    void build() {
        Outcome first = runQuery(cache.path(), root, L"[SIZE]>=0");
        ASSERT_EQ(0, first.signal);
        ASSERT_EQ(0, first.rc);
        ASSERT_EQ(expected, first.hits);
        ASSERT_TRUE(testsupport::fileExists(cacheFile("files.dat")));
    }

    // The damaged cache answers -40 without crashing; close removed it, and
    // the next query rebuilds it and answers whole.
    void expectCaughtThenRebuilt(const std::wstring& text, std::multiset<std::string> const& whole) {
        Outcome damaged = runQuery(cache.path(), root, text);
        ASSERT_EQ(0, damaged.signal) << "the query died of signal " << damaged.signal;
        EXPECT_EQ(CACHE_UNUSABLE, damaged.rc) << "hits: " << damaged.hits.size();
        EXPECT_FALSE(testsupport::fileExists(cacheFile("files.dat")));
        Outcome again = runQuery(cache.path(), root, text);
        ASSERT_EQ(0, again.signal);
        EXPECT_EQ(0, again.rc);
        EXPECT_EQ(whole, again.hits);
    }
};

}  // namespace

TEST(DamagedCacheCursorTest, FieldAccessByAMissingOrMistypedColumnFailsInsteadOfCrashing)
{
    testsupport::TempDir dir;
    testsupport::TempDir locks;
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        LinuxSharedMutex::setStorePath(locks.path().c_str());
        FS_Table table(L"t", widen(dir.path()).c_str(), false);
        table.addField(L"ID", FIELD_INT32);
        table.addField(L"NAME", FIELD_TEXT);
        if (!table.create())
            _exit(2);
        RecordSet set = table.openRecordSet();
        // Missing columns: setters store nothing, getters answer 0 or null.
        set.setFieldAsInt8(L"NOPE", 1);
        set.setFieldAsInt16(L"NOPE", 1);
        set.setFieldAsInt32(L"NOPE", 1);
        set.setFieldAsInt64(L"NOPE", 1);
        set.setFieldAsString(L"NOPE", L"x");
        unsigned char hex[3] = {2, 1, 2};
        set.setFieldAsHex(L"NOPE", hex);
        set.setFieldAsInt32(7u, 1);
        if (set.getFieldAsInt8(L"NOPE") != 0 || set.getFieldAsInt16(L"NOPE") != 0 ||
            set.getFieldAsInt32(L"NOPE") != 0 || set.getFieldAsInt64(L"NOPE") != 0 ||
            set.getFieldAsString(L"NOPE") != nullptr || set.getFieldAsHex(L"NOPE") != nullptr ||
            set.getFieldAsInt32(7u) != 0 || set.getFieldAsString(9u) != nullptr)
            _exit(3);
        // A column of another type than the call's is not touched.
        set.setFieldAsString(L"ID", L"text over a number");
        set.setFieldAsInt64(L"NAME", 0x4141414141414141ull);
        set.setFieldAsInt32(L"ID", 42);
        set.setFieldAsString(L"NAME", L"name");
        if (set.getFieldAsInt32(L"ID") != 42 || set.getFieldAsString(L"ID") != nullptr ||
            set.getFieldAsInt64(L"NAME") != 0 || std::wstring(set.getFieldAsString(1u)) != L"name")
            _exit(4);
        _exit(0);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    ASSERT_FALSE(WIFSIGNALED(status)) << "died of signal " << WTERMSIG(status);
    EXPECT_EQ(0, WEXITSTATUS(status));
}

TEST_F(DamagedCacheTest, ZeroedStartOfTheDirectoriesDataFileAnswersUnusableNotACrash)
{
    build();
    overwrite(cacheFile("directories.dat"), 0, std::string(64, '\0'));
    expectCaughtThenRebuilt(L"[SIZE]>=0", expected);
}

TEST_F(DamagedCacheTest, EmptyFilesPointerFileAnswersUnusableNotNoHits)
{
    build();
    ASSERT_EQ(0, truncate(cacheFile("files.pxx").c_str(), 0));
    expectCaughtThenRebuilt(L"[SIZE]>=0", expected);
}

TEST_F(DamagedCacheTest, FourBytesOfFFInAStoredFileNameAnswerUnusableNotACutName)
{
    build();
    std::string data = testsupport::readFile(cacheFile("files.dat"));
    size_t at = data.find("alphabet_soup.txt");
    ASSERT_NE(std::string::npos, at);
    overwrite(cacheFile("files.dat"), at + 8, std::string(4, '\xff'));
    expectCaughtThenRebuilt(L"[SIZE]>=0", expected);
}

TEST_F(DamagedCacheTest, GarbageInTheDirectoriesPointerFileIsRefusedBeforeAnyHitIsServed)
{
    build();
    std::string garbage;
    unsigned int seed = 12345;
    for (int i = 0; i < 256; ++i) {
        seed = seed * 1103515245u + 12345u;
        garbage += static_cast<char>((seed >> 16) & 0xff);
    }
    overwrite(cacheFile("directories.pxx"), 0, garbage);
    // Caught when the cache opens, before a single row is served, and the
    // trace names the pointer file.
    {
        testsupport::TraceCapture capture;
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue,
                   L"prov");
        ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
        FsQuery q;
        q.setQuery(L"[SIZE]>=0");
        q.addIncludePath(widen(root).c_str(), true);
        HitWriter writer;
        EXPECT_EQ(CACHE_UNUSABLE, c.executeQueryEx(writer, q, 600000, LONG_AGE));
        EXPECT_TRUE(writer.hits.empty()) << writer.hits.size() << " hits served from the damaged cache";
        c.close();
        EXPECT_TRUE(capture.contains("damaged cache file '" + cacheFile("directories.pxx") + "'"))
            << capture.dump();
    }
    EXPECT_FALSE(testsupport::fileExists(cacheFile("files.dat")));
    Outcome again = runQuery(cache.path(), root, L"[SIZE]>=0");
    ASSERT_EQ(0, again.signal);
    EXPECT_EQ(0, again.rc);
    EXPECT_EQ(expected, again.hits);
}

TEST_F(DamagedCacheTest, TruncatedFileNameIndexAnswersUnusableNotNothingForExactNames)
{
    build();
    ASSERT_EQ(0, truncate(cacheFile("files_FILENAME.idx").c_str(), 300000));
    std::multiset<std::string> soup = {root + "/dir1/alphabet_soup.txt"};
    expectCaughtThenRebuilt(L"[FILENAME]==\"alphabet_soup.txt\"", soup);
}

TEST_F(DamagedCacheTest, DamageFoundAtOpenIsTracedWithTheFileAndTheCheck)
{
    build();
    ASSERT_EQ(0, truncate(cacheFile("files.pxx").c_str(), 0));
    testsupport::TraceCapture capture;
    FsGlue glue = testsupport::plainGlue();
    FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(root).c_str(), true);
    HitWriter writer;
    EXPECT_EQ(CACHE_UNUSABLE, c.executeQueryEx(writer, q, 600000, LONG_AGE));
    EXPECT_TRUE(writer.hits.empty());
    c.close();
    EXPECT_TRUE(capture.contains("damaged cache file")) << capture.dump();
    EXPECT_TRUE(capture.contains("files.dat': stored count differs from the live slots"))
        << capture.dump();
}

TEST_F(DamagedCacheTest, DamageFoundByAReadDuringTheQueryIsTracedWithTheFileAndTheCheck)
{
    build();
    std::string data = testsupport::readFile(cacheFile("files.dat"));
    size_t at = data.find("alphabet_soup.txt");
    ASSERT_NE(std::string::npos, at);
    // One letter for another: the record's shape is sound, its key is not
    // the one its index entries are filed under.
    overwrite(cacheFile("files.dat"), at, "z");
    testsupport::TraceCapture capture;
    FsGlue glue = testsupport::plainGlue();
    FS_Cache c(L"directories", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(root).c_str(), true);
    HitWriter writer;
    EXPECT_EQ(CACHE_UNUSABLE, c.executeQueryEx(writer, q, 600000, LONG_AGE));
    c.close();
    EXPECT_FALSE(testsupport::fileExists(cacheFile("files.dat")));
    EXPECT_TRUE(capture.contains("record does not hold the key its index entry is filed under"))
        << capture.dump();
}
