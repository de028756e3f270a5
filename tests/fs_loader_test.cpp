// Tests of the configuration source, the provider loader and the clean-up
// list.  The provider libraries come from tests/helpers and are copied into a
// temporary "fscanner.home" for each test.
#include <gtest/gtest.h>

#include <dlfcn.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <string>
#include <vector>

#include "base/KelCfg.h"
#include "fscanner/fs/fs_loader.h"
#include "helpers/test_provider.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

const std::string kHelpersDir = std::string(FSCANNER_TEST_BINARY_DIR) + "/test_helpers";

// Copies a built helper library into dir under the name file.
std::string installLibrary(const TempDir& dir, const std::string& helper, const std::string& file) {
    std::string source = kHelpersDir + "/" + helper;
    std::string content = testsupport::readFile(source);
    EXPECT_FALSE(content.empty()) << "helper library missing: " << source;
    return dir.write(file, content);
}

bool isLoaded(const std::string& path) {
    void* handle = dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD);
    if (handle == nullptr) return false;
    dlclose(handle);  // drops only the reference taken just now
    return true;
}

class ConfigTest : public ::testing::Test {
protected:
    void SetUp() override { KelCfg::clear(); }
    void TearDown() override { KelCfg::clear(); }
    FsConfig_KEL config;
};

// A configuration whose getString always answers with one text, to show that
// getInteger reads through the virtual slot.
class FixedTextConfig : public FsConfig_KEL {
public:
    explicit FixedTextConfig(const std::string& text) : text_(text) {}
    std::string getString(const char*, const char*, const char*) const override { return text_; }

private:
    std::string text_;
};

int integerOf(const char* text, int defaultValue = 77) {
    FixedTextConfig config(text);
    return config.getInteger("s", "k", defaultValue);
}

}  // namespace

// ---- FsConfig_KEL ---------------------------------------------------------------

TEST_F(ConfigTest, GetStringJoinsSectionAndKeyWithDot) {
    KelCfg::setKey("fscanner.home", "/opt/fscanner");
    EXPECT_EQ(config.getString("fscanner", "home", "."), "/opt/fscanner");
}

TEST_F(ConfigTest, GetStringGivesDefaultForMissingOrEmptyValue) {
    EXPECT_EQ(config.getString("fscanner", "home", "."), ".");
    EXPECT_EQ(config.getString("fscanner", "home", nullptr), "");
    KelCfg::setKey("fscanner.home", "");
    EXPECT_EQ(config.getString("fscanner", "home", "dflt"), "dflt");
}

TEST_F(ConfigTest, GetErrorIsWhatKelCfgReports) {
    EXPECT_STREQ(static_cast<const char*>(config.getError()), "");
    TempDir dir;
    std::string path = dir.write("bad.cfg", "no equals sign here\nkey=value\n");
    KelCfg::loadFile(path.c_str());
    String expected = KelCfg::getError();
    EXPECT_GT(expected.length(), 0);
    EXPECT_STREQ(static_cast<const char*>(config.getError()), static_cast<const char*>(expected));
}

TEST_F(ConfigTest, GetIntegerSuffixes) {
    KelCfg::setKey("buf.a", "4k");
    KelCfg::setKey("buf.b", "4K");
    KelCfg::setKey("buf.c", "2M");
    KelCfg::setKey("buf.d", "-1k");
    KelCfg::setKey("buf.e", "3m");
    EXPECT_EQ(config.getInteger("buf", "a", 0), 4096);
    EXPECT_EQ(config.getInteger("buf", "b", 0), 4096);
    EXPECT_EQ(config.getInteger("buf", "c", 0), 2097152);
    EXPECT_EQ(config.getInteger("buf", "d", 0), -1024);
    EXPECT_EQ(config.getInteger("buf", "e", 0), 3145728);
}

TEST_F(ConfigTest, GetIntegerOfMissingKeyGivesDefault) {
    EXPECT_EQ(config.getInteger("buf", "none", -9), -9);
}

TEST(GetInteger, MalformedTextsGiveDefault) {
    EXPECT_EQ(integerOf("12x"), 77);
    EXPECT_EQ(integerOf("k"), 77);
    EXPECT_EQ(integerOf(""), 77);
    EXPECT_EQ(integerOf("--"), 77);
    EXPECT_EQ(integerOf("4kk"), 77);
    EXPECT_EQ(integerOf("4 "), 77);
    EXPECT_EQ(integerOf(" 4"), 77);
    EXPECT_EQ(integerOf("0x10"), 77);
}

TEST(GetInteger, EachMinusFlipsTheSignAndPlusIsSkipped) {
    EXPECT_EQ(integerOf("--5"), 5);
    EXPECT_EQ(integerOf("+-5"), -5);
    EXPECT_EQ(integerOf("-+-+-5"), -5);
    EXPECT_EQ(integerOf("+7"), 7);
    EXPECT_EQ(integerOf("0"), 0);
    EXPECT_EQ(integerOf("-0"), 0);
}

TEST(GetInteger, DigitsWrapInThirtyTwoBitsWithoutOverflowTest) {
    EXPECT_EQ(integerOf("2147483647"), 2147483647);
    EXPECT_EQ(integerOf("4294967297"), 1);
    EXPECT_EQ(integerOf("3000000000"), -1294967296);
    EXPECT_EQ(integerOf("4194304k"), 0);
}

// ---- loading ------------------------------------------------------------------------

TEST(CreateProviderSymbol, NamesTheFactory) { EXPECT_STREQ(createProviderSymbol, "createProvider"); }

class LoaderTest : public ::testing::Test {
protected:
    void SetUp() override {
        KelCfg::clear();
        KelCfg::setKey("fscanner.home", home.path().c_str());
    }
    void TearDown() override { KelCfg::clear(); }
    TempDir home;
    FsConfig_KEL config;
};

TEST_F(LoaderTest, LoadsLibraryFromHomeAndFindsSymbol) {
    std::string path = installLibrary(home, "test_provider.so", "prov.so");
    TraceCapture capture;
    void* handle = reinterpret_cast<void*>(1);
    void* factory = loadLibraryAndFactory("prov", &config, "createProvider", &handle);
    ASSERT_NE(factory, nullptr) << capture.dump();
    ASSERT_NE(handle, nullptr);
    EXPECT_EQ(factory, dlsym(handle, "createProvider"));
    EXPECT_TRUE(isLoaded(path));
    EXPECT_TRUE(capture.contains("DLL prefix = " + home.path() + "/\n")) << capture.dump();
}

TEST_F(LoaderTest, PrefixTraceGoesOutAtMaximumLevel) {
    TraceCapture capture;
    loadLibraryAndFactory("absent", &config, "createProvider", nullptr);
    bool atMax = false;
    for (const QvLogWrapper::Message& m : capture.messages()) {
        if (m.text == "DLL prefix = " + home.path() + "/\n") atMax = m.level == QvLogWrapper::LEVEL_MAX;
    }
    EXPECT_TRUE(atMax) << capture.dump();
}

TEST_F(LoaderTest, MissingLibraryTracesDlerrorAndGivesNull) {
    TraceCapture capture;
    void* handle = reinterpret_cast<void*>(1);
    EXPECT_EQ(loadLibraryAndFactory("absent", &config, "createProvider", &handle), nullptr);
    EXPECT_EQ(handle, nullptr);
    EXPECT_TRUE(capture.contains("*** Error: cannot load DLL '" + home.path() + "/absent.so' (")) << capture.dump();
}

TEST_F(LoaderTest, MissingSymbolGivesNullHandleButLibraryStaysLoaded) {
    std::string path = installLibrary(home, "test_noprovider.so", "noprov.so");
    TraceCapture capture;
    void* handle = reinterpret_cast<void*>(1);
    EXPECT_EQ(loadLibraryAndFactory("noprov", &config, "createProvider", &handle), nullptr);
    EXPECT_EQ(handle, nullptr);
    EXPECT_TRUE(isLoaded(path));
    EXPECT_FALSE(capture.contains("cannot load DLL")) << capture.dump();
}

TEST_F(LoaderTest, NullHandleArgumentIsAllowed) {
    installLibrary(home, "test_provider.so", "prov2.so");
    EXPECT_NE(loadLibraryAndFactory("prov2", &config, "createProvider", nullptr), nullptr);
}

TEST_F(LoaderTest, NameOfTwoThousandBytesOrMoreIsRefusedWithoutLoading) {
    std::string prefix = home.path() + "/";
    // name + 3 + prefix == 2000: refused before dlopen, so no error trace.
    std::string name(2000 - 3 - prefix.size(), 'n');
    TraceCapture capture;
    void* handle = reinterpret_cast<void*>(1);
    EXPECT_EQ(loadLibraryAndFactory(name.c_str(), &config, "createProvider", &handle), nullptr);
    EXPECT_EQ(handle, nullptr);
    EXPECT_FALSE(capture.contains("cannot load DLL")) << capture.dump();
    // One byte shorter still goes to dlopen (and fails there).
    std::string shorter(name.size() - 1, 'n');
    EXPECT_EQ(loadLibraryAndFactory(shorter.c_str(), &config, "createProvider", &handle), nullptr);
    EXPECT_TRUE(capture.contains("cannot load DLL '" + prefix + shorter + ".so'")) << capture.dump();
}

TEST_F(LoaderTest, DefaultHomeIsCurrentDirectory) {
    KelCfg::removeKey("fscanner.home");
    TempDir dir;
    installLibrary(dir, "test_provider.so", "here.so");
    char buffer[4096];
    std::string old = getcwd(buffer, sizeof(buffer)) != nullptr ? buffer : "/";
    ASSERT_EQ(chdir(dir.path().c_str()), 0);
    TraceCapture capture;
    void* factory = loadLibraryAndFactory("here", &config, "createProvider", nullptr);
    ASSERT_EQ(chdir(old.c_str()), 0);
    EXPECT_NE(factory, nullptr) << capture.dump();
    EXPECT_TRUE(capture.contains("DLL prefix = ./\n")) << capture.dump();
}

TEST_F(LoaderTest, NullConfigFailsCleanly) {
    void* handle = reinterpret_cast<void*>(1);
    EXPECT_EQ(loadLibraryAndFactory("prov", nullptr, "createProvider", &handle), nullptr);
    EXPECT_EQ(handle, nullptr);
}

TEST_F(LoaderTest, LoadFsProviderCallsFactoryWithConfig) {
    std::string path = installLibrary(home, "test_provider.so", "provider_a.so");
    KelCfg::setKey("provider.marker", "seen");
    TraceCapture capture;
    void* object = FsLoader::loadFsProvider("provider_a", &config);
    ASSERT_NE(object, nullptr) << capture.dump();
    TestProvider* provider = static_cast<TestProvider*>(object);
    EXPECT_EQ(provider->magic, TestProvider::kMagic);
    EXPECT_EQ(provider->config, &config);
    EXPECT_EQ(provider->marker, "seen");
    delete provider;
    // The handle is dropped, never closed: the provider stays loaded.
    EXPECT_TRUE(isLoaded(path));
    EXPECT_TRUE(capture.contains("FsLoader::loadFsProvider - entering...\n")) << capture.dump();
    EXPECT_TRUE(capture.contains("FsLoader::loadFsProvider - exit\n")) << capture.dump();
}

TEST_F(LoaderTest, LoadFsProviderWithEmptyNameReturnsNullWithoutDlopen) {
    // A library that an empty name would reach: "<home>/.so".
    std::string decoy = installLibrary(home, "test_provider.so", ".so");
    TraceCapture capture;
    EXPECT_EQ(FsLoader::loadFsProvider("", &config), nullptr);
    EXPECT_EQ(FsLoader::loadFsProvider(nullptr, &config), nullptr);
    EXPECT_FALSE(isLoaded(decoy));
    EXPECT_FALSE(capture.contains("cannot load DLL")) << capture.dump();
    EXPECT_EQ(capture.count("FsLoader::loadFsProvider - entering...\n"), 2u);
    EXPECT_EQ(capture.count("FsLoader::loadFsProvider - exit\n"), 2u);
}

TEST_F(LoaderTest, LoadFsProviderWithoutFactoryReturnsNull) {
    installLibrary(home, "test_noprovider.so", "nofactory.so");
    EXPECT_EQ(FsLoader::loadFsProvider("nofactory", &config), nullptr);
}

TEST_F(LoaderTest, LoadFsProviderOfMissingLibraryReturnsNull) {
    TraceCapture capture;
    EXPECT_EQ(FsLoader::loadFsProvider("missing", &config), nullptr);
    EXPECT_TRUE(capture.contains("*** Error: cannot load DLL '" + home.path() + "/missing.so'")) << capture.dump();
}

// ---- FsResourceManager -------------------------------------------------------------------

namespace {

std::vector<std::string> calls;

void recordA(int code, void* data) {
    calls.push_back("A" + std::to_string(code) + ":" + static_cast<const char*>(data));
}

void recordB(int code, void* data) {
    calls.push_back("B" + std::to_string(code) + ":" + static_cast<const char*>(data));
}

char dataX[] = "x";
char dataY[] = "y";

}  // namespace

TEST(FsResourceManager, GetInstanceIsASingleton) {
    FsResourceManager* first = FsResourceManager::getInstance();
    ASSERT_NE(first, nullptr);
    EXPECT_EQ(FsResourceManager::getInstance(), first);
}

TEST(FsResourceManager, HandlersRunLastInFirstOutAndStayRegistered) {
    FsResourceManager* manager = FsResourceManager::getInstance();
    calls.clear();
    manager->addCleanupHandler(recordA, dataX);
    manager->addCleanupHandler(recordB, dataY);
    manager->invokeCleanupHandlers(3);
    EXPECT_EQ(calls, (std::vector<std::string>{"B3:y", "A3:x"}));
    manager->invokeCleanupHandlers(4);
    EXPECT_EQ(calls, (std::vector<std::string>{"B3:y", "A3:x", "B4:y", "A4:x"}));
    manager->removeCleanupHandler(recordA, dataX);
    manager->removeCleanupHandler(recordB, dataY);
    calls.clear();
    manager->invokeCleanupHandlers(5);
    EXPECT_TRUE(calls.empty());
}

TEST(FsResourceManager, HandlerRegisteredTwiceRunsTwiceAndOneRemovalTakesOne) {
    FsResourceManager* manager = FsResourceManager::getInstance();
    calls.clear();
    manager->addCleanupHandler(recordA, dataX);
    manager->addCleanupHandler(recordA, dataX);
    manager->invokeCleanupHandlers(1);
    EXPECT_EQ(calls, (std::vector<std::string>{"A1:x", "A1:x"}));
    manager->removeCleanupHandler(recordA, dataX);
    calls.clear();
    manager->invokeCleanupHandlers(2);
    EXPECT_EQ(calls, (std::vector<std::string>{"A2:x"}));
    manager->removeCleanupHandler(recordA, dataX);
    calls.clear();
    manager->invokeCleanupHandlers(2);
    EXPECT_TRUE(calls.empty());
}

TEST(FsResourceManager, RemovalNeedsBothHandlerAndData) {
    FsResourceManager* manager = FsResourceManager::getInstance();
    calls.clear();
    manager->addCleanupHandler(recordA, dataX);
    manager->removeCleanupHandler(recordA, dataY);
    manager->removeCleanupHandler(recordB, dataX);
    manager->invokeCleanupHandlers(0);
    EXPECT_EQ(calls, (std::vector<std::string>{"A0:x"}));
    manager->removeCleanupHandler(recordA, dataX);
    // Nothing left: a removal of an absent entry does nothing.
    manager->removeCleanupHandler(recordA, dataX);
    calls.clear();
    manager->invokeCleanupHandlers(0);
    EXPECT_TRUE(calls.empty());
}

TEST(FsResourceManager, RemovalTakesTheFirstMatchFromTheHead) {
    FsResourceManager* manager = FsResourceManager::getInstance();
    calls.clear();
    manager->addCleanupHandler(recordA, dataX);
    manager->addCleanupHandler(recordB, dataY);
    manager->addCleanupHandler(recordA, dataX);
    manager->removeCleanupHandler(recordA, dataX);
    manager->invokeCleanupHandlers(9);
    // The newest A went; B and the older A remain in that order.
    EXPECT_EQ(calls, (std::vector<std::string>{"B9:y", "A9:x"}));
    manager->removeCleanupHandler(recordA, dataX);
    manager->removeCleanupHandler(recordB, dataY);
}

namespace {

void writeMarker(int, void* data) {
    FILE* file = std::fopen(static_cast<const char*>(data), "w");
    if (file != nullptr) std::fclose(file);
}

}  // namespace

TEST(FsResourceManagerDeathTest, ProcessExitFreesEntriesWithoutCallingThem) {
    TempDir dir;
    std::string marker = dir.file("called");
    EXPECT_EXIT(
        {
            FsResourceManager::getInstance()->addCleanupHandler(writeMarker, const_cast<char*>(marker.c_str()));
            std::exit(0);
        },
        ::testing::ExitedWithCode(0), "");
    EXPECT_FALSE(testsupport::fileExists(marker));
    // The same handler does write the marker when invoked, so the check above
    // can fail.
    FsResourceManager::getInstance()->addCleanupHandler(writeMarker, const_cast<char*>(marker.c_str()));
    FsResourceManager::getInstance()->invokeCleanupHandlers(0);
    FsResourceManager::getInstance()->removeCleanupHandler(writeMarker, const_cast<char*>(marker.c_str()));
    EXPECT_TRUE(testsupport::fileExists(marker));
}
