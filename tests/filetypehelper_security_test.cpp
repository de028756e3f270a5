// The file type check runs shell commands that quote a path without escaping
// it.  These tests pin that a path which would break out of those quotes, a
// bare list file name with shell syntax, or a name that `file` would read as
// an option never reaches a shell: the check answers false and traces why,
// and the command hidden in the name never runs.
//
// The hostile names try to create a file named "pwned"; each test looks for
// it in the working directory it ran in, the fixture and the process's own
// working directory.
#include <gtest/gtest.h>

#include <unistd.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fscommon/filetypehelper.h"
#include "fscanner/fscommon/fsbuild.h"
#include "support/testsupport.h"

namespace {

using testsupport::TempDir;
using testsupport::TraceCapture;
using testsupport::fileExists;

std::wstring W(const std::string& s) { return std::wstring(s.begin(), s.end()); }

bool haveFileCommand() {
    int status = -1;
    testsupport::runCommand("command -v file >/dev/null 2>&1", &status);
    return status == 0;
}

#define REQUIRE_FILE_COMMAND()                                                  \
    do {                                                                        \
        if (!haveFileCommand()) GTEST_SKIP() << "needs the `file` command";     \
    } while (0)

std::string currentDirectory() {
    char buf[4096];
    return getcwd(buf, sizeof buf) != nullptr ? std::string(buf) : std::string();
}

// Steps into a directory for the life of the object.
class WorkingDirectory {
public:
    explicit WorkingDirectory(const std::string& dir) : saved_(currentDirectory()) {
        ok_ = chdir(dir.c_str()) == 0;
    }
    ~WorkingDirectory() {
        if (!saved_.empty() && chdir(saved_.c_str()) != 0) std::perror("chdir back");
    }
    bool ok() const { return ok_; }

private:
    std::string saved_;
    bool ok_ = false;
};

// A fixture root with a hostile directory holding one text file, and a
// separate working directory for the run.
class HostileNameTest : public ::testing::Test {
protected:
    void SetUp() override {
        FileTypeChecker::batchCache().clear();
        FileTypeChecker::listCache().clear();
        processDir = currentDirectory();
        ASSERT_FALSE(fileExists(processDir + "/pwned")) << "left over from elsewhere";
    }
    void TearDown() override {
        FileTypeChecker::batchCache().clear();
        FileTypeChecker::listCache().clear();
    }

    // Every place the hidden command could have written to.
    void expectNothingPwned(const std::string& hostileDir) {
        EXPECT_FALSE(fileExists(work.file("pwned")));
        EXPECT_FALSE(fileExists(fixture.file("pwned")));
        EXPECT_FALSE(fileExists(hostileDir + "/pwned"));
        EXPECT_FALSE(fileExists(processDir + "/pwned"));
    }

    // Every entry point that would put dir (or a path in it) between double
    // quotes must answer false without running anything.
    void expectEveryQuotedFormRefused(const std::string& hostileName) {
        std::string dir = fixture.mkdirs(hostileName);
        std::string file = dir + "/a.txt";
        fixture.write(hostileName + "/a.txt", "some words\n");
        WorkingDirectory cwd(work.path());
        ASSERT_TRUE(cwd.ok());

        FileTypeChecker checker;
        StringList<wchar_t> types, include, exclude;
        types.insert(L"text");
        include.insert(L"text");
        TraceCapture capture;
        wchar_t* line = nullptr;
        EXPECT_FALSE(checker.getFileType(W(file).c_str(), &line));
        EXPECT_FALSE(checker.getFileTypeEx(W(file).c_str(), &line));
        // One entry in the directory: the one-file command on the path.
        EXPECT_FALSE(checker.getFileTypeEx_2(W(file).c_str(), &line));
        EXPECT_EQ(nullptr, line);
        EXPECT_FALSE(checker.check(W(file).c_str(), types));
        EXPECT_FALSE(checker.check(W(dir).c_str(), L"a.txt", types));
        EXPECT_FALSE(checker.check(W(dir).c_str(), L"a.txt", include, exclude));

        EXPECT_EQ(0u, capture.count("running")) << capture.dump();
        EXPECT_GE(capture.count("which would break the quoted command; not run"), 5u) << capture.dump();
        expectNothingPwned(dir);
    }

    TempDir fixture;
    TempDir work;
    std::string processDir;
};

TEST_F(HostileNameTest, ControlTheHostileNameInjectsWhenRunUnguarded) {
    // Proves the fixture is hostile: the directory command built by hand
    // around this name, run by a shell, does create the file.
    std::string dir = fixture.mkdirs("x\";touch pwned;\"");
    char cmd[8192];
    snprintf(cmd, sizeof cmd, FileTypeChecker::DIRECTORY_COMMAND, dir.c_str());
    {
        WorkingDirectory cwd(work.path());
        ASSERT_TRUE(cwd.ok());
        testsupport::runCommand(std::string("(") + cmd + ") 2>/dev/null");
    }
    EXPECT_TRUE(fileExists(work.file("pwned")) || fileExists(dir + "/pwned") ||
                fileExists(fixture.file("pwned")));
    // Clean up, so that the other tests start from nothing.
    std::remove(work.file("pwned").c_str());
    std::remove((dir + "/pwned").c_str());
    std::remove(fixture.file("pwned").c_str());
}

TEST_F(HostileNameTest, DoubleQuoteInDirectoryNeverReachesAShell) {
    expectEveryQuotedFormRefused("x\";touch pwned;\"");
}

TEST_F(HostileNameTest, BackquoteInDirectoryNeverReachesAShell) {
    expectEveryQuotedFormRefused("y`touch pwned`");
}

TEST_F(HostileNameTest, DollarInDirectoryNeverReachesAShell) {
    expectEveryQuotedFormRefused("z$(touch pwned)");
}

TEST_F(HostileNameTest, BackslashInDirectoryNeverReachesAShell) {
    expectEveryQuotedFormRefused("v\\");
}

TEST_F(HostileNameTest, RefusalTraceNamesTheCharacter) {
    std::string dir = fixture.mkdirs("x\";touch pwned;\"");
    fixture.write("x\";touch pwned;\"/a.txt", "words\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileType(W(dir + "/a.txt").c_str(), &line));
    EXPECT_TRUE(capture.contains("FileTypeChecker::getFileType - path '" + dir +
                                 "/a.txt' holds '\"', which would break the quoted command; not run\n"))
        << capture.dump();
    EXPECT_FALSE(checker.getFileTypeEx(W(dir + "/a.txt").c_str(), &line));
    EXPECT_TRUE(capture.contains("FileTypeChecker::getFileTypeEx - directory '" + dir +
                                 "' holds '\"', which would break the quoted command; not run\n"))
        << capture.dump();
    expectNothingPwned(dir);
}

TEST_F(HostileNameTest, HostileEntryNamesInAListedDirectoryStayArguments) {
    REQUIRE_FILE_COMMAND();
    // The directory itself is harmless; its entries go through `ls | xargs`
    // to `file` as arguments, never through a shell.
    fixture.mkdirs("x\";touch pwned;\"");
    fixture.write("$(touch pwned)", "words\n");
    fixture.write("`touch pwned`", "words\n");
    std::string plain = fixture.write("plain.txt", "words\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    StringList<wchar_t> text;
    text.insert(L"text");
    EXPECT_TRUE(checker.check(W(plain).c_str(), text));
    expectNothingPwned(fixture.file("x\";touch pwned;\""));
}

TEST_F(HostileNameTest, ListFileModeClassifiesAHostileDirectoryWithoutAShellOnItsName) {
    REQUIRE_FILE_COMMAND();
    // With more than one entry the names go through the list file, which the
    // shell never reads, so even the hostile directory is answered.
    std::string dir = fixture.mkdirs("x\";touch pwned;\"");
    std::string file = fixture.write("x\";touch pwned;\"/a.txt", "words\n");
    fixture.write("x\";touch pwned;\"/b.txt", "");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx_2(W(file).c_str(), &line));
    std::string answer(line, line + wcslen(line));
    kelm_free(line);
    EXPECT_EQ(0u, answer.rfind(file + ":", 0)) << answer;
    EXPECT_NE(std::string::npos, answer.find("ASCII text")) << answer;
    expectNothingPwned(dir);
}

TEST_F(HostileNameTest, ListFileNameWithShellSyntaxIsRefused) {
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    std::string text = fixture.write("a.txt", "words\n");
    FileTypeChecker checker;
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    for (const char* name : {"l;touch pwned", "l$(touch pwned)", "l`touch pwned`", "l|touch pwned",
                             "l&&touch pwned", "l>pwned"}) {
        work.write(name, text + "\n");
        std::vector<bool> results;
        TraceCapture capture;
        EXPECT_EQ(-1, checker.check(W(name).c_str(), include, exclude, results)) << name;
        EXPECT_TRUE(results.empty()) << name;
        EXPECT_EQ(0u, capture.count("running")) << capture.dump();
        EXPECT_TRUE(capture.contains("holds shell syntax")) << capture.dump();
        expectNothingPwned(fixture.path());
    }
}

TEST_F(HostileNameTest, EntryThatFileWouldReadAsAnOptionStopsTheBatch) {
    std::string plain = fixture.write("plain.txt", "words\n");
    fixture.write("-i", "words\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileTypeEx(W(plain).c_str(), &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
    EXPECT_TRUE(capture.contains("FileTypeChecker::getFileTypeEx - entry '-i' of '" + fixture.path() +
                                 "' would be read as an option; not run\n"))
        << capture.dump();
}

TEST_F(HostileNameTest, PathThatBeginsWithADashIsRefused) {
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    work.write("-i", "words\n");
    work.mkdirs("-d");
    work.write("-d/a.txt", "words\n");
    FileTypeChecker checker;
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileType(L"-i", &line));
    EXPECT_FALSE(checker.getFileTypeEx(L"-d/a.txt", &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
    EXPECT_EQ(2u, capture.count("would be read as an option; not run")) << capture.dump();
}

TEST_F(HostileNameTest, MissingDirectoryIsNotAnsweredFromTheWorkingDirectory) {
    REQUIRE_FILE_COMMAND();
    // Were `cd` allowed to fail, `ls` would list the working directory and
    // its "a.txt" would answer for "missing/a.txt".
    work.write("a.txt", "words\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileTypeEx(L"missing/a.txt", &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
    EXPECT_TRUE(capture.contains("cannot open directory 'missing'")) << capture.dump();
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
}

TEST_F(HostileNameTest, RelativeDirectoryIsClassifiedFromTheWorkingDirectory) {
    REQUIRE_FILE_COMMAND();
    work.mkdirs("sub");
    work.write("sub/a.txt", "words\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    FileTypeChecker checker;
    StringList<wchar_t> text;
    text.insert(L"text");
    EXPECT_TRUE(checker.check(L"sub/a.txt", text));
}

}  // namespace
