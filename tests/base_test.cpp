// Tests of the host services: allocator, String, KelCfg, CpuThreshold, tracing.
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <cwchar>

#include "base/CpuThreshold.h"
#include "base/KelCfg.h"
#include "base/QvLogWrapper.h"
#include "base/String.h"
#include "base/kelmem.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

TEST(Allocator, StrdupCopiesAndNullStaysNull) {
    char* copy = i_strdup("abc");
    ASSERT_NE(copy, nullptr);
    EXPECT_STREQ(copy, "abc");
    kelm_free(copy);
    EXPECT_EQ(i_strdup(nullptr), nullptr);
    kelm_free(nullptr);
}

TEST(Allocator, ReallocKeepsContents) {
    char* b = static_cast<char*>(kelm_malloc(4));
    std::memcpy(b, "xyz", 4);
    b = static_cast<char*>(kelm_realloc(b, 4096));
    ASSERT_NE(b, nullptr);
    EXPECT_STREQ(b, "xyz");
    kelm_free(b);
    void* z = kelm_malloc(0);
    EXPECT_NE(z, nullptr);
    kelm_free(z);
}

TEST(StringValue, LengthCharAtAndConversion) {
    String s("hello");
    EXPECT_EQ(s.length(), 5);
    EXPECT_EQ(s.charAt(0), 'h');
    EXPECT_EQ(s.charAt(4), 'o');
    EXPECT_EQ(s.charAt(5), '\0');
    EXPECT_EQ(s.charAt(-1), '\0');
    EXPECT_STREQ(static_cast<const char*>(s), "hello");
    String empty(nullptr);
    EXPECT_EQ(empty.length(), 0);
    EXPECT_STREQ(static_cast<const char*>(empty), "");
}

TEST(StringValue, CopiesAreDeepAndCompareHonoursCase) {
    String a("Abc");
    String b(a);
    String c;
    c = a;
    a = String("zzz");
    EXPECT_STREQ(static_cast<const char*>(b), "Abc");
    EXPECT_STREQ(static_cast<const char*>(c), "Abc");
    EXPECT_EQ(b.compareTo(String("Abc"), 0), 0);
    EXPECT_NE(b.compareTo(String("abc"), 0), 0);
    EXPECT_EQ(b.compareTo(String("abc"), 1), 0);
    EXPECT_LT(String("a").compareTo(String("b"), 0), 0);
}

class KelCfgTest : public ::testing::Test {
protected:
    void TearDown() override { KelCfg::reset(); }
};

TEST_F(KelCfgTest, ReadsKeyValueLinesFromTheFileNamedByTheEnvironment) {
    TempDir dir;
    std::string path = dir.write("cfg", "# comment\n\n  fscanner.home = /opt/x  \nempty=\nnum=12\n");
    setenv("FSCANNER_CONFIG", path.c_str(), 1);
    KelCfg::reset();
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("fscanner.home")), "/opt/x");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("num")), "12");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("empty")), "");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("missing")), "");
    EXPECT_EQ(KelCfg::getError().length(), 0);
    unsetenv("FSCANNER_CONFIG");
}

TEST_F(KelCfgTest, FileIsReadOnceOnFirstUse) {
    TempDir dir;
    std::string path = dir.write("cfg", "a=1\n");
    setenv("FSCANNER_CONFIG", path.c_str(), 1);
    KelCfg::reset();
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("a")), "1");
    dir.write("cfg", "a=2\n");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("a")), "1");
    unsetenv("FSCANNER_CONFIG");
}

TEST_F(KelCfgTest, BadLinesAreSkippedAndReported) {
    TempDir dir;
    std::string path = dir.write("cfg", "good=yes\nthis line has no equals\n=novalue\nlater=ok\n");
    ASSERT_TRUE(KelCfg::loadFile(path.c_str()));
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("good")), "yes");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("later")), "ok");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("this line has no equals")), "");
    std::string err = static_cast<const char*>(KelCfg::getError());
    EXPECT_NE(err.find("line 2"), std::string::npos) << err;
}

TEST_F(KelCfgTest, MissingFileMeansNoKeysAndAnError) {
    setenv("FSCANNER_CONFIG", "/nonexistent/fscanner.cfg", 1);
    KelCfg::reset();
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("fscanner.home")), "");
    std::string err = static_cast<const char*>(KelCfg::getError());
    EXPECT_NE(err.find("/nonexistent/fscanner.cfg"), std::string::npos) << err;
    unsetenv("FSCANNER_CONFIG");
}

TEST_F(KelCfgTest, UnsetVariableMeansNoKeys) {
    unsetenv("FSCANNER_CONFIG");
    KelCfg::reset();
    EXPECT_EQ(KelCfg::getKey("x").length(), 0);
    EXPECT_NE(KelCfg::getError().length(), 0);
}

TEST_F(KelCfgTest, InProcessSetterOverridesAndClears) {
    KelCfg::clear();
    KelCfg::setKey("k", "v");
    EXPECT_STREQ(static_cast<const char*>(KelCfg::getKey("k")), "v");
    KelCfg::removeKey("k");
    EXPECT_EQ(KelCfg::getKey("k").length(), 0);
}

TEST(CpuThresholdTest, NullShortOrZeroSleepTextMeansNoThrottling) {
    CpuThreshold::Initialize(nullptr);
    EXPECT_FALSE(CpuThreshold::isActive());
    CpuThreshold::Initialize("1:2:3");
    EXPECT_FALSE(CpuThreshold::isActive());
    CpuThreshold::Initialize("0:0:100:0");
    EXPECT_FALSE(CpuThreshold::isActive());
    CpuThreshold::Initialize("0:0:100:50");
    EXPECT_TRUE(CpuThreshold::isActive());
    EXPECT_EQ(CpuThreshold::runMilliseconds(), 100);
    EXPECT_EQ(CpuThreshold::sleepMilliseconds(), 50);
    CpuThreshold::Initialize(nullptr);
}

TEST(CpuThresholdTest, ConstantsArePositive) {
    EXPECT_GT(CpuThreshold::CPU_THROTTLE_NO_OF_SCANNED_FILES_FACTOR, 0);
    EXPECT_GT(CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_NORMAL, 0);
    EXPECT_GT(CpuThreshold::CPU_THROTTLE_ITERATION_FACTOR_SMALL, 0);
}

namespace {
double now(clockid_t id) {
    timespec ts{};
    clock_gettime(id, &ts);
    return ts.tv_sec + ts.tv_nsec / 1e9;
}
}  // namespace

TEST(CpuThresholdTest, HalfShareHoldsForABusyLoop) {
    CpuThreshold::Initialize("0:0:50:50");
    double wall0 = now(CLOCK_MONOTONIC), cpu0 = now(CLOCK_PROCESS_CPUTIME_ID);
    volatile unsigned long sink = 0;
    while (now(CLOCK_PROCESS_CPUTIME_ID) - cpu0 < 0.6) {
        for (int i = 0; i < 20000; ++i) sink = sink + i;
        CpuThreshold::doIteration();
    }
    double wall = now(CLOCK_MONOTONIC) - wall0, cpu = now(CLOCK_PROCESS_CPUTIME_ID) - cpu0;
    unsigned long long slept = CpuThreshold::sleptMilliseconds();
    CpuThreshold::Initialize(nullptr);
    // The throttle bounds the share from above.  A loaded machine may give
    // the loop less than its share, in which case there is nothing to sleep
    // for, so neither a lower bound nor a sleep is certain; but a share above
    // the limit can only come from sleeping too little.
    EXPECT_LT(cpu / wall, 0.75) << "cpu " << cpu << " wall " << wall << " slept " << slept;
}

TEST(CpuThresholdTest, OffMeansNoSleep) {
    CpuThreshold::Initialize(nullptr);
    for (int i = 0; i < 1000; ++i) CpuThreshold::doIteration();
    EXPECT_EQ(CpuThreshold::sleptMilliseconds(), 0u);
    EXPECT_EQ(CpuThreshold::iterations(), 1000u);
}

TEST(Tracing, OffByDefaultButCaptureSeesEverything) {
    QvLogWrapper* log = getQvLogFs();
    log->configure(0, nullptr);
    EXPECT_FALSE(log->istraceActive(QvLogWrapper::LEVEL_MIN));
    {
        TraceCapture capture;
        EXPECT_TRUE(log->istraceActive(QvLogWrapper::LEVEL_MAX));
        log->traceMIN(__LINE__, __FILE__, __func__, "IMPORTANT: %s::%s - n=%d", "A", "b", 7);
        log->traceMAX(__LINE__, __FILE__, __func__, "wide '%S' and '%ls'", L"x\u00e9", L"y");
        auto m = capture.messages();
        ASSERT_EQ(m.size(), 2u);
        EXPECT_EQ(m[0].level, QvLogWrapper::LEVEL_MIN);
        EXPECT_EQ(m[0].text, "IMPORTANT: A::b - n=7");
        EXPECT_EQ(m[1].text, "wide 'x\xc3\xa9' and 'y'");
    }
    EXPECT_FALSE(log->istraceActive(QvLogWrapper::LEVEL_MIN));
}

TEST(Tracing, CaptureLevelLimitsWhatIsKept) {
    TraceCapture capture(QvLogWrapper::LEVEL_MIN);
    getQvLogFs()->traceMID(__LINE__, __FILE__, __func__, "mid");
    getQvLogFs()->traceMIN(__LINE__, __FILE__, __func__, "min");
    ASSERT_EQ(capture.messages().size(), 1u);
    EXPECT_EQ(capture.messages()[0].text, "min");
}

TEST(Tracing, WritesToTheConfiguredFileWithPrefix) {
    TempDir dir;
    std::string path = dir.file("trace.log");
    QvLogWrapper* log = getQvLogFs();
    ASSERT_TRUE(log->configure(2, path.c_str()));
    log->traceMID(12, "/x/y/file.cpp", "fn", "hello %u", 5u);
    log->traceMAX(13, "/x/y/file.cpp", "fn", "not written");
    log->configure(0, nullptr);
    std::string text = testsupport::readFile(path);
    EXPECT_EQ(text, "2 file.cpp:12 fn: hello 5\n");
}

TEST(Tracing, FormatterHandlesWidthsPrecisionAndPercent) {
    EXPECT_EQ(QvLogWrapper::format("%5d|%-3s|%.2f|%%|%llu|%lx", 42, "a", 1.005, 18446744073709551615ULL,
                                   255UL),
              "   42|a  |1.00|%|18446744073709551615|ff");
    const wchar_t* volatile none = nullptr;
    EXPECT_EQ(QvLogWrapper::format("%S", none), "(null)");
    EXPECT_EQ(QvLogWrapper::format("%0.1f%%", 50.0), "50.0%");
}

TEST(KelmFailAfter, ServesTheGivenNumberOfRequestsThenFailsUntilEnded) {
    kelm_failAfter(2);
    void* a = kelm_malloc(8);
    void* b = kelm_realloc(a, 64);
    ASSERT_NE(nullptr, a);
    ASSERT_NE(nullptr, b);
    EXPECT_EQ(nullptr, kelm_malloc(8));
    // A failed realloc leaves the old block valid and untouched.
    std::memset(b, 'x', 64);
    EXPECT_EQ(nullptr, kelm_realloc(b, 128));
    EXPECT_EQ('x', static_cast<char*>(b)[63]);
    EXPECT_EQ(nullptr, i_strdup("text"));
    kelm_failAfter(-1);
    char* copy = i_strdup("text");
    ASSERT_NE(nullptr, copy);
    EXPECT_STREQ("text", copy);
    kelm_free(copy);
    kelm_free(b);
}
