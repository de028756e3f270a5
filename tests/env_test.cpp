// The library's door to the operating system: the forwarding wrapper,
// installing and restoring an Env, and failures injected through it that
// reach the library as the clean errors it promises.
#include "fscanner/fscommon/env.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <string>

#include <gtest/gtest.h>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_loader.h"
#include "fscanner/fs/fs_query.h"
#include "fscanner/fs/fs_resultset_file.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/sysfile.h"
#include "support/cachefixture.h"
#include "support/error_env.h"
#include "support/testsupport.h"

using fscanner::Env;
using fscanner::EnvWrapper;
using testsupport::EnvCall;
using testsupport::ErrorEnv;
using testsupport::ScopedEnv;
using testsupport::TempDir;
using testsupport::widen;

namespace {

const unsigned int LONG_AGE = 10u * 365u * 86400u;

// Counts the calls it forwards, nothing else.
class CountingEnv : public EnvWrapper {
public:
    CountingEnv() : EnvWrapper(Env::Default()) {}
    int openFile(const char* path, int flags, mode_t mode) override {
        ++opens;
        return EnvWrapper::openFile(path, flags, mode);
    }
    int opens = 0;
};

TEST(Env, DefaultIsCurrentWhenNothingIsInstalled) {
    EXPECT_NE(nullptr, Env::Default());
    EXPECT_EQ(Env::Default(), Env::Current());
}

TEST(Env, InstallReturnsTheEnvBeforeAndNullRestoresTheDefault) {
    CountingEnv counting;
    EXPECT_EQ(Env::Default(), Env::Install(&counting));
    EXPECT_EQ(&counting, Env::Current());
    EXPECT_EQ(&counting, Env::Install(nullptr));
    EXPECT_EQ(Env::Default(), Env::Current());
}

TEST(Env, ScopedEnvPutsBackTheEnvBefore) {
    CountingEnv outer;
    ScopedEnv a(&outer);
    {
        ErrorEnv inner;
        ScopedEnv b(&inner);
        EXPECT_EQ(&inner, Env::Current());
    }
    EXPECT_EQ(&outer, Env::Current());
}

TEST(EnvWrapper, ForwardsFileCallsToItsTarget) {
    TempDir dir;
    EnvWrapper wrapper(Env::Default());
    std::string path = dir.file("f");
    int fd = wrapper.openFile(path.c_str(), O_RDWR | O_CREAT | O_TRUNC, 0600);
    ASSERT_GE(fd, 0);
    EXPECT_EQ(5, wrapper.writeFile(fd, "hello", 5));
    char buffer[8] = {0};
    EXPECT_EQ(3, wrapper.readFileAt(fd, buffer, 3, 1));
    EXPECT_STREQ("ell", buffer);
    EXPECT_EQ(0, wrapper.truncateFile(fd, 2));
    struct stat st;
    EXPECT_EQ(0, wrapper.fileStatus(fd, &st));
    EXPECT_EQ(2, st.st_size);
    EXPECT_EQ(0, wrapper.closeFile(fd));
    std::string renamed = dir.file("g");
    EXPECT_EQ(0, wrapper.renameFile(path.c_str(), renamed.c_str()));
    EXPECT_EQ(0, wrapper.status(renamed.c_str(), &st));
    EXPECT_EQ(0, wrapper.removeFile(renamed.c_str()));
    EXPECT_EQ(-1, wrapper.status(renamed.c_str(), &st));
    EXPECT_EQ(ENOENT, errno);
}

TEST(EnvWrapper, TheLibraryReachesTheInstalledEnv) {
    TempDir dir;
    CountingEnv counting;
    ScopedEnv installed(&counting);
    LinuxMmFile f(dir.file("m").c_str());
    ASSERT_TRUE(f.create());
    EXPECT_EQ(1, counting.opens);
    f.close();
}

TEST(EnvHelpers, ReadFileToStringReadsAllAndFailsForAMissingFile) {
    TempDir dir;
    std::string big(20000, 'x');
    dir.write("big", big);
    std::string content;
    EXPECT_TRUE(fscanner::ReadFileToString(Env::Default(), dir.file("big").c_str(), &content));
    EXPECT_EQ(big, content);
    EXPECT_FALSE(fscanner::ReadFileToString(Env::Default(), dir.file("none").c_str(), &content));
    EXPECT_EQ(ENOENT, errno);
}

TEST(ErrorEnv, FailsTheNthCallOfAKindOnly) {
    TempDir dir;
    dir.write("a", "1");
    ErrorEnv env;
    env.failNth(EnvCall::Status, 2, EIO);
    struct stat st;
    EXPECT_EQ(0, env.status(dir.file("a").c_str(), &st));
    EXPECT_EQ(-1, env.status(dir.file("a").c_str(), &st));
    EXPECT_EQ(EIO, errno);
    EXPECT_EQ(0, env.status(dir.file("a").c_str(), &st));
    EXPECT_EQ(3, env.calls(EnvCall::Status));
    EXPECT_EQ(1, env.injected());
}

TEST(ErrorEnv, FailsWritesOnADescriptorByThePathItWasOpenedWith) {
    TempDir dir;
    ErrorEnv env;
    env.failPath(EnvCall::WriteFile, "victim", ENOSPC);
    int other = env.openFile(dir.file("other").c_str(), O_WRONLY | O_CREAT, 0600);
    int victim = env.openFile(dir.file("victim").c_str(), O_WRONLY | O_CREAT, 0600);
    EXPECT_EQ(1, env.writeFile(other, "x", 1));
    EXPECT_EQ(-1, env.writeFile(victim, "x", 1));
    EXPECT_EQ(ENOSPC, errno);
    env.closeFile(other);
    env.closeFile(victim);
}

TEST(ErrorEnv, RunsAnActionAtTheChosenCall) {
    TempDir dir;
    ErrorEnv env;
    int ran = 0;
    // "/b": the temporary directory's own name may hold a "b".
    env.actAt(EnvCall::RemoveFile, "/b", 1, [&] { ++ran; });
    env.removeFile(dir.file("a").c_str());
    EXPECT_EQ(0, ran);
    env.removeFile(dir.file("b").c_str());
    env.removeFile(dir.file("b").c_str());
    EXPECT_EQ(1, ran);
}

// ---- injected failures as the library reports them

TEST(InjectedFailure, NoSpaceAtReservationRefusesTheMappedWrite) {
    TempDir dir;
    ErrorEnv env;
    env.failPath(EnvCall::ReserveSpace, "full.bin", ENOSPC);
    ScopedEnv installed(&env);
    LinuxMmFile f(dir.file("full.bin").c_str());
    ASSERT_TRUE(f.create());
    char byte = 'x';
    errno = 0;
    EXPECT_EQ(0u, f.write(&byte, 1));
    EXPECT_EQ(ENOSPC, errno);
    EXPECT_EQ(0u, f.logicalSize());
    f.close();
}

struct CacheUnderEnv : ::testing::Test {
    testsupport::MachineFixture machine;
    TempDir tree;
    TempDir cache;
    std::string root;
    CacheUnderEnv() {
        tree.write("a/one.txt", "1");
        tree.write("a/two.txt", "22");
        tree.write("b/three.txt", "333");
        root = tree.path();
    }
    // One query through a new FS_Cache over the cache directory.
    int query(testsupport::HitWriter& writer, int* reason = nullptr) {
        FsGlue glue = testsupport::plainGlue();
        FS_Cache c(L"dirs", L"files", widen(cache.path()).c_str(), false, true, &glue, L"prov");
        int rc = c.create(0, FS_CACHE_OPEN_ALWAYS);
        if (rc != 0) return rc;
        FsQuery q;
        q.setQuery(L"[SIZE]>=0");
        q.addIncludePath(widen(root).c_str(), true);
        rc = c.executeQueryEx(writer, q, 600000, LONG_AGE);
        if (reason != nullptr) *reason = errno;
        c.close();
        return rc;
    }
};

TEST_F(CacheUnderEnv, NoSpaceAtReservationGivesTheFullDiskResult) {
    ErrorEnv env;
    env.failPath(EnvCall::ReserveSpace, "files.pxx", ENOSPC);
    testsupport::HitWriter writer;
    int reason = 0;
    {
        ScopedEnv installed(&env);
        EXPECT_EQ(CACHE_ERROR, query(writer, &reason));
    }
    EXPECT_EQ(ENOSPC, reason);
    EXPECT_TRUE(writer.hits.empty());
    EXPECT_GE(env.injected(), 1);
    // With room again the tree is built and served whole.
    testsupport::HitWriter again;
    EXPECT_EQ(0, query(again));
    EXPECT_EQ(testsupport::findFiles(root), again.hits);
}

TEST_F(CacheUnderEnv, UnreadableProviderMarkIsTracedAsAnInvalidCache) {
    testsupport::HitWriter first;
    ASSERT_EQ(0, query(first));
    ErrorEnv env;
    env.failPath(EnvCall::OpenFile, "pr_hash", EACCES);
    testsupport::TraceCapture capture;
    testsupport::HitWriter writer;
    {
        ScopedEnv installed(&env);
        EXPECT_EQ(0, query(writer));
    }
    EXPECT_TRUE(capture.contains("(cacheValid check1) unable to determine previous provider, therefore cache is invalid."))
        << capture.dump();
    EXPECT_TRUE(capture.contains("(cacheValid check1) failed to update previous cache MD5 for future scans!"))
        << capture.dump();
    EXPECT_EQ(testsupport::findFiles(root), writer.hits);
}

TEST_F(CacheUnderEnv, FailedWriteOfTheExcludeMarkIsTraced) {
    ErrorEnv env;
    env.failPath(EnvCall::WriteFile, "ex_hash", EIO);
    testsupport::TraceCapture capture;
    testsupport::HitWriter writer;
    {
        ScopedEnv installed(&env);
        EXPECT_EQ(0, query(writer));
    }
    EXPECT_TRUE(capture.contains("cannot write '" + cache.path() + "/ex_hash': " + std::strerror(EIO)))
        << capture.dump();
}

TEST_F(CacheUnderEnv, ServedQueryWritesSyncsAndTruncatesNothing) {
    testsupport::HitWriter first;
    ASSERT_EQ(0, query(first));
    ErrorEnv env;
    testsupport::HitWriter writer;
    {
        ScopedEnv installed(&env);
        EXPECT_EQ(0, query(writer));
    }
    EXPECT_EQ(testsupport::findFiles(root), writer.hits);
    // The tables were only read and every mark already held its content.
    EXPECT_EQ(0, env.calls(EnvCall::WriteFile));
    EXPECT_EQ(0, env.calls(EnvCall::SyncFile));
    EXPECT_EQ(0, env.calls(EnvCall::SyncMapping));
    EXPECT_EQ(0, env.calls(EnvCall::TruncateFile));
    EXPECT_EQ(0, env.calls(EnvCall::ReserveSpace));
    EXPECT_GT(env.calls(EnvCall::MapFile), 0);
}

TEST_F(CacheUnderEnv, ChangedProviderRewritesTheMark) {
    testsupport::HitWriter first;
    ASSERT_EQ(0, query(first));
    std::string before = testsupport::readFile(cache.file("pr_hash"));
    ASSERT_EQ(16u, before.size());
    FsGlue glue = testsupport::plainGlue();
    FS_Cache c(L"dirs", L"files", widen(cache.path()).c_str(), false, true, &glue, L"other");
    ASSERT_EQ(0, c.create(0, FS_CACHE_OPEN_ALWAYS));
    FsQuery q;
    q.setQuery(L"[SIZE]>=0");
    q.addIncludePath(widen(root).c_str(), true);
    testsupport::HitWriter writer;
    EXPECT_EQ(0, c.executeQueryEx(writer, q, 600000, LONG_AGE));
    c.close();
    std::string after = testsupport::readFile(cache.file("pr_hash"));
    EXPECT_EQ(16u, after.size());
    EXPECT_NE(before, after);
}

TEST_F(CacheUnderEnv, ProviderMarkWithTrailingBytesIsRewrittenToSixteen) {
    testsupport::HitWriter first;
    ASSERT_EQ(0, query(first));
    std::string mark = testsupport::readFile(cache.file("pr_hash"));
    cache.write("pr_hash", mark + "tail");
    testsupport::HitWriter writer;
    ASSERT_EQ(0, query(writer));
    EXPECT_EQ(mark, testsupport::readFile(cache.file("pr_hash")));
}

TEST(InjectedFailure, TmpnamWithoutANameSendsTheResultSetToItsFallback) {
    TempDir dir;
    char buffer[4096];
    std::string old = getcwd(buffer, sizeof buffer) != nullptr ? buffer : "/";
    ASSERT_EQ(0, chdir(dir.path().c_str()));
    FsResultSet_OnFile::resetTempNameSources();
    ErrorEnv env;
    env.failNth(EnvCall::TempName, 1, EEXIST);
    std::string name;
    {
        ScopedEnv installed(&env);
        testsupport::TraceCapture capture;
        FsResultSet_OnFile set;
        name = set.getFileName();
        EXPECT_TRUE(capture.contains("The temp file name is: ./fsq_0")) << capture.dump();
        EXPECT_TRUE(testsupport::fileExists(dir.file("fsq_0")));
    }
    EXPECT_EQ("./fsq_0", name);
    EXPECT_EQ(1, env.calls(EnvCall::TempName));
    ASSERT_EQ(0, chdir(old.c_str()));
}

// ---- the loader

struct LoaderUnderEnv : ::testing::Test {
    void SetUp() override {
        KelCfg::clear();
        KelCfg::setKey("fscanner.home", home.path().c_str());
    }
    void TearDown() override { KelCfg::clear(); }
    TempDir home;
    FsConfig_KEL config;
};

TEST_F(LoaderUnderEnv, FailedLoadGivesTheLoadersError) {
    home.write("prov.so", "not really a library");
    ErrorEnv env;
    env.failPath(EnvCall::LoadLibrary, "prov.so", ENOENT);
    testsupport::TraceCapture capture;
    void* handle = reinterpret_cast<void*>(1);
    {
        ScopedEnv installed(&env);
        EXPECT_EQ(nullptr, loadLibraryAndFactory("prov", &config, "createProvider", &handle));
    }
    EXPECT_EQ(nullptr, handle);
    EXPECT_EQ(1, env.calls(EnvCall::LoadLibrary));
    std::string library = home.path() + "/prov.so";
    EXPECT_TRUE(capture.contains("*** Error: cannot load DLL '" + library + "' (" + library + ": " +
                                 std::strerror(ENOENT) + ")"))
        << capture.dump();
}

}  // namespace
