// Behaviour of the file type check: the cache of answers, the word matching,
// the checks against a `file` line in hand, and the runs of the system's
// `file` command over one file, a directory and a list file.
//
// Tests that run `file` say so with REQUIRE_FILE_COMMAND() and are skipped
// cleanly when the command is absent.  Every fixture lives in a temporary
// directory; tests that make the list file of getFileTypeEx_2 (which is
// relative to the working directory) step into a temporary directory first.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <clocale>
#include <cstdint>
#include <cstdio>
#include <cwchar>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fscommon/filetypehelper.h"
#include "fscanner/fscommon/fsbuild.h"
#include "support/testsupport.h"

namespace {

using testsupport::TempDir;
using testsupport::TraceCapture;

std::wstring W(const std::string& s) { return std::wstring(s.begin(), s.end()); }

std::string N(const wchar_t* s) {
    std::string out;
    for (; s != nullptr && *s != L'\0'; ++s) out += static_cast<char>(*s);
    return out;
}

// The line with every run of blanks made one blank: `file` pads the name
// field to the longest name of a run, which differs between runs.
std::string squeeze(const std::string& line) {
    std::string out;
    for (char c : line) {
        if (c == ' ' && !out.empty() && out.back() == ' ') continue;
        out += c;
    }
    return out;
}

bool haveFileCommand() {
    int status = -1;
    testsupport::runCommand("command -v file >/dev/null 2>&1", &status);
    return status == 0;
}

#define REQUIRE_FILE_COMMAND()                                                  \
    do {                                                                        \
        if (!haveFileCommand()) GTEST_SKIP() << "needs the `file` command";     \
    } while (0)

// What the system's `file` says of one path, the whole line.
std::string systemFileLine(const std::string& path) {
    return testsupport::runCommand("LANG=C; export LANG; file \"" + path + "\" 2>/dev/null");
}

// The words of a `file` line's description, cut independently of the code
// under test: everything behind "path:", split at blank, tab, ",", ":" and
// line feed.
std::set<std::string> systemWords(const std::string& path) {
    std::string line = systemFileLine(path);
    std::set<std::string> words;
    if (line.compare(0, path.size() + 1, path + ":") != 0) return words;
    std::string word;
    for (char c : line.substr(path.size() + 1)) {
        if (c == ' ' || c == '\t' || c == ',' || c == ':' || c == '\n') {
            if (!word.empty()) words.insert(word);
            word.clear();
        } else {
            word += c;
        }
    }
    if (!word.empty()) words.insert(word);
    return words;
}

void fillList(StringList<wchar_t>& list, std::initializer_list<const wchar_t*> items) {
    for (const wchar_t* item : items) list.insert(item);
}

std::vector<std::wstring> listItems(const StringList<wchar_t>& list) {
    std::vector<std::wstring> out;
    for (int i = 0; i < list.size(); ++i) out.push_back(list.at(i));
    return out;
}

// Steps into a directory for the life of the object.
class WorkingDirectory {
public:
    explicit WorkingDirectory(const std::string& dir) {
        char buf[4096];
        if (getcwd(buf, sizeof buf) != nullptr) saved_ = buf;
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

// A directory of four kinds of file: an ELF binary, a shell script, a text
// file and an empty file.
struct KindsFixture {
    TempDir dir;
    std::string elf, script, text, empty;
    KindsFixture() {
        elf = dir.file("prog");
        std::ifstream in("/bin/true", std::ios::binary);
        std::ofstream out(elf, std::ios::binary);
        out << in.rdbuf();
        out.close();
        chmod(elf.c_str(), 0755);
        script = dir.write("run.sh", "#!/bin/sh\necho hello\n");
        chmod(script.c_str(), 0755);
        text = dir.write("notes.txt", "just some words\nin two lines\n");
        empty = dir.write("nothing", "");
    }
};

class FileTypeCheckerTest : public ::testing::Test {
protected:
    void SetUp() override {
        FileTypeChecker::batchCache().clear();
        FileTypeChecker::listCache().clear();
    }
    void TearDown() override {
        FileTypeChecker::batchCache().clear();
        FileTypeChecker::listCache().clear();
    }
    FileTypeChecker checker;
};

// ---- Element ---------------------------------------------------------------

TEST(ElementTest, EmptyElementHasIdMinusOneAndNoText) {
    Element e;
    EXPECT_EQ(-1, e.getID());
    EXPECT_EQ(nullptr, e.getFileTypeInfo());
}

TEST(ElementTest, ConstructorAndCopyOwnTheirOwnText) {
    wchar_t text[] = L"/d/a: ASCII text\n";
    Element e(5, text);
    text[0] = L'X';
    ASSERT_NE(nullptr, e.getFileTypeInfo());
    EXPECT_STREQ(L"/d/a: ASCII text\n", e.getFileTypeInfo());
    Element copy(e);
    EXPECT_EQ(5, copy.getID());
    EXPECT_NE(e.getFileTypeInfo(), copy.getFileTypeInfo());
    EXPECT_STREQ(e.getFileTypeInfo(), copy.getFileTypeInfo());
    Element assigned;
    assigned = e;
    EXPECT_EQ(5, assigned.getID());
    EXPECT_NE(e.getFileTypeInfo(), assigned.getFileTypeInfo());
    EXPECT_STREQ(L"/d/a: ASCII text\n", assigned.getFileTypeInfo());
}

TEST(ElementTest, SetDataCopiesOrTakesTheBlock) {
    Element e;
    wchar_t mine[] = L"/d/b: empty\n";
    e.setData(3, mine, true);
    EXPECT_EQ(3, e.getID());
    EXPECT_NE(mine, e.getFileTypeInfo());
    EXPECT_STREQ(L"/d/b: empty\n", e.getFileTypeInfo());

    wchar_t* block = static_cast<wchar_t*>(kelm_malloc(4 * sizeof(wchar_t)));
    wcscpy(block, L"abc");
    e.setData(4, block, false);
    EXPECT_EQ(4, e.getID());
    EXPECT_EQ(block, e.getFileTypeInfo());

    wchar_t* released = e.releaseFileTypeInfo();
    EXPECT_EQ(block, released);
    EXPECT_EQ(nullptr, e.getFileTypeInfo());
    EXPECT_EQ(4, e.getID());
    kelm_free(released);
}

// ---- FileTypeCache ---------------------------------------------------------

TEST(FileTypeCacheTest, CapacityIsAtLeast4096AndLastBatchStartsAtMinusOne) {
    FileTypeCache small(10);
    EXPECT_EQ(4096u, small.getCapacity());
    FileTypeCache large(5000);
    EXPECT_EQ(5000u, large.getCapacity());
    FileTypeCache plain;
    EXPECT_EQ(4096u, plain.getCapacity());
    EXPECT_EQ(-1, plain.getLastBatchId());
    EXPECT_EQ(0u, plain.size());
}

TEST(FileTypeCacheTest, InsertAppendsAndNotesTheBatch) {
    FileTypeCache cache;
    cache.insert(Element(7, L"/d/a: empty\n"));
    EXPECT_EQ(7, cache.getLastBatchId());
    cache.insert(Element(8, L"/d/b: empty\n"));
    EXPECT_EQ(8, cache.getLastBatchId());
    EXPECT_EQ(2u, cache.size());
}

TEST(FileTypeCacheTest, FindConsumesTheHitSoAnAnswerServesOnce) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/d/a: ASCII text\n"));
    Element hit = cache.find(L"/d/a:", true);
    EXPECT_EQ(1, hit.getID());
    EXPECT_STREQ(L"/d/a: ASCII text\n", hit.getFileTypeInfo());
    EXPECT_EQ(0u, cache.size());
    Element again = cache.find(L"/d/a:", true);
    EXPECT_EQ(-1, again.getID());
    EXPECT_EQ(nullptr, again.getFileTypeInfo());
}

TEST(FileTypeCacheTest, FindTakesTheOldestMatchingEntryFirst) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/d/a: old\n"));
    cache.insert(Element(2, L"/d/a: new\n"));
    EXPECT_STREQ(L"/d/a: old\n", cache.find(L"/d/a:", true).getFileTypeInfo());
    EXPECT_STREQ(L"/d/a: new\n", cache.find(L"/d/a:", true).getFileTypeInfo());
}

TEST(FileTypeCacheTest, FindMatchesTheBeginningOnly) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/d/ab: empty\n"));
    cache.insert(Element(1, L"/x/y: see /d/a: here\n"));
    EXPECT_EQ(-1, cache.find(L"/d/a:", true).getID());
    EXPECT_EQ(2u, cache.size());
}

TEST(FileTypeCacheTest, FindFlagHasNoEffect) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/d/a: empty\n"));
    cache.insert(Element(1, L"/d/b: empty\n"));
    EXPECT_EQ(1, cache.find(L"/d/a:", false).getID());
    EXPECT_EQ(1, cache.find(L"/d/b:", true).getID());
    EXPECT_EQ(0u, cache.size());
}

TEST(FileTypeCacheTest, FindWithNullKeyGivesAnEmptyElement) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/d/a: empty\n"));
    EXPECT_EQ(-1, cache.find(nullptr, true).getID());
    EXPECT_EQ(1u, cache.size());
}

TEST(FileTypeCacheTest, FullCacheDropsTheOldestWholeBatch) {
    FileTypeCache cache;
    for (int i = 0; i < 2000; ++i) cache.insert(Element(1, (L"/one/" + std::to_wstring(i) + L": x").c_str()));
    for (int i = 0; i < 2000; ++i) cache.insert(Element(2, (L"/two/" + std::to_wstring(i) + L": x").c_str()));
    for (int i = 0; i < 96; ++i) cache.insert(Element(3, (L"/three/" + std::to_wstring(i) + L": x").c_str()));
    ASSERT_EQ(4096u, cache.size());
    cache.insert(Element(4, L"/four/0: x"));
    // All 2000 entries of batch 1 went at once, nothing of batch 2 or 3.
    EXPECT_EQ(2097u, cache.size());
    EXPECT_EQ(-1, cache.find(L"/one/1999:", true).getID());
    EXPECT_EQ(2, cache.find(L"/two/0:", true).getID());
    EXPECT_EQ(3, cache.find(L"/three/95:", true).getID());
    EXPECT_EQ(4, cache.find(L"/four/0:", true).getID());
}

TEST(FileTypeCacheTest, OverflowNeverDropsTheBatchBeingRead) {
    FileTypeCache cache;
    cache.insert(Element(1, L"/old/0: x"));
    for (int i = 0; i < 4095; ++i) cache.insert(Element(2, (L"/cur/" + std::to_wstring(i) + L": x").c_str()));
    ASSERT_EQ(4096u, cache.size());
    // The older batch goes; the batch being read stays whole beyond capacity.
    for (int i = 4095; i < 4200; ++i) cache.insert(Element(2, (L"/cur/" + std::to_wstring(i) + L": x").c_str()));
    EXPECT_EQ(4200u, cache.size());
    EXPECT_EQ(-1, cache.find(L"/old/0:", true).getID());
    EXPECT_EQ(2, cache.find(L"/cur/0:", true).getID());
    EXPECT_EQ(2, cache.find(L"/cur/4199:", true).getID());
    EXPECT_EQ(4198u, cache.size());
    // The next batch finds the list full and drops the whole previous batch.
    cache.insert(Element(3, L"/next/0: x"));
    EXPECT_EQ(1u, cache.size());
    EXPECT_EQ(3, cache.getLastBatchId());
}

TEST(FileTypeCacheTest, DroppingLooksAtTheOldestEndOnly) {
    FileTypeCache cache;
    cache.insert(Element(5, L"/five/0: x"));
    for (int i = 0; i < 4095; ++i) cache.insert(Element(6, (L"/six/" + std::to_wstring(i) + L": x").c_str()));
    ASSERT_EQ(4096u, cache.size());
    // The oldest entry is of the new element's batch: nothing is dropped,
    // not even the younger batch behind it.
    cache.insert(Element(5, L"/five/1: x"));
    EXPECT_EQ(4097u, cache.size());
    EXPECT_EQ(5, cache.getLastBatchId());
    EXPECT_EQ(6, cache.find(L"/six/0:", true).getID());
}

TEST(FileTypeCacheTest, PrintTracesEveryEntry) {
    FileTypeCache cache;
    cache.insert(Element(3, L"/d/a: ASCII text\n"));
    cache.insert(Element(4, L"/d/b: empty\n"));
    TraceCapture capture;
    cache.print();
    EXPECT_TRUE(capture.contains("[3] - /d/a: ASCII text\n")) << capture.dump();
    EXPECT_TRUE(capture.contains("[4] - /d/b: empty\n")) << capture.dump();
}

// ---- words -----------------------------------------------------------------

TEST_F(FileTypeCheckerTest, CommandTextsAreExact) {
    EXPECT_STREQ("LANG=C; export LANG; file \"%s\" 2>/dev/null", FileTypeChecker::FILE_COMMAND);
    EXPECT_STREQ("cd \"%s\";LANG=C; export LANG; ls | xargs file 2> /dev/null",
                 FileTypeChecker::DIRECTORY_COMMAND);
    EXPECT_STREQ("LANG=C; export LANG; file -f %s 2>/dev/null", FileTypeChecker::LIST_COMMAND);
}

TEST_F(FileTypeCheckerTest, ListFileNameIsTheObjectsAddressInHex) {
    char expected[64];
    snprintf(expected, sizeof expected, "./kel_cmd_file_%lx",
             static_cast<unsigned long>(reinterpret_cast<uintptr_t>(&checker)));
    EXPECT_STREQ(expected, checker.getListFileName());
}

TEST_F(FileTypeCheckerTest, SplitterCutsAtLineFeedBlankCommaAndColon) {
    StringList<wchar_t> words;
    wchar_t text[] = L"/d/a: ELF 64-bit LSB,x86-64\nstripped";
    ASSERT_TRUE(checker.fileTypeSplitter(text, words));
    std::vector<std::wstring> expected = {L"/d/a", L"ELF", L"64-bit", L"LSB", L"x86-64", L"stripped"};
    EXPECT_EQ(expected, listItems(words));
    EXPECT_STREQ(L"/d/a: ELF 64-bit LSB,x86-64\nstripped", text);  // cut on a copy
}

TEST_F(FileTypeCheckerTest, SplitterKeepsTabsInsideWords) {
    StringList<wchar_t> words;
    wchar_t text[] = L"a\tb c";
    ASSERT_TRUE(checker.fileTypeSplitter(text, words));
    std::vector<std::wstring> expected = {L"a\tb", L"c"};
    EXPECT_EQ(expected, listItems(words));
}

TEST_F(FileTypeCheckerTest, SplitterAppendsToWhatTheListHolds) {
    StringList<wchar_t> words;
    words.insert(L"first");
    wchar_t text[] = L"second";
    ASSERT_TRUE(checker.fileTypeSplitter(text, words));
    std::vector<std::wstring> expected = {L"first", L"second"};
    EXPECT_EQ(expected, listItems(words));
}

TEST_F(FileTypeCheckerTest, SplitterOfNullOrDelimitersOnlyIsFalse) {
    StringList<wchar_t> words;
    EXPECT_FALSE(checker.fileTypeSplitter(nullptr, words));
    wchar_t delimiters[] = L" ,:\n , ";
    EXPECT_FALSE(checker.fileTypeSplitter(delimiters, words));
    wchar_t empty[] = L"";
    EXPECT_FALSE(checker.fileTypeSplitter(empty, words));
    EXPECT_EQ(0, words.size());
}

TEST_F(FileTypeCheckerTest, WantedEntryOfSeveralWordsMeansAnyOfThem) {
    StringList<wchar_t> elfWords, scriptWords, textWords, wanted;
    fillList(elfWords, {L"ELF", L"64-bit", L"LSB", L"executable"});
    fillList(scriptWords, {L"POSIX", L"shell", L"script", L"ASCII", L"text", L"executable"});
    fillList(textWords, {L"ASCII", L"text"});
    fillList(wanted, {L"ELF, script"});
    EXPECT_TRUE(checker.checkTypeList(elfWords, wanted));
    EXPECT_TRUE(checker.checkTypeList(scriptWords, wanted));
    EXPECT_FALSE(checker.checkTypeList(textWords, wanted));
}

TEST_F(FileTypeCheckerTest, CheckTypeListComparesWholeWordsWithCase) {
    StringList<wchar_t> fileWords, lower, part, later;
    fillList(fileWords, {L"ELF", L"executable"});
    fillList(lower, {L"elf"});
    fillList(part, {L"EL"});
    fillList(later, {L"text", L"executable"});
    EXPECT_FALSE(checker.checkTypeList(fileWords, lower));
    EXPECT_FALSE(checker.checkTypeList(fileWords, part));
    EXPECT_TRUE(checker.checkTypeList(fileWords, later));
}

TEST_F(FileTypeCheckerTest, CheckTypeListSkipsAnEntryThatGivesNoWord) {
    StringList<wchar_t> fileWords, wanted;
    fillList(fileWords, {L"ASCII", L"text"});
    fillList(wanted, {L" , ", L"text"});
    TraceCapture capture;
    EXPECT_TRUE(checker.checkTypeList(fileWords, wanted));
    EXPECT_TRUE(capture.contains("FileTypeChecker::checkTypeList - fileTypeSplitter of ' , ' failed!\n"))
        << capture.dump();
}

TEST_F(FileTypeCheckerTest, CheckTypeListWithNothingWantedIsFalse) {
    StringList<wchar_t> fileWords, wanted;
    fillList(fileWords, {L"ASCII", L"text"});
    EXPECT_FALSE(checker.checkTypeList(fileWords, wanted));
}

// ---- checks against a line in hand -----------------------------------------

TEST_F(FileTypeCheckerTest, LineCheckWithBothListsEmptyIsTrue) {
    StringList<wchar_t> include, exclude;
    wchar_t line[] = L"/other: ELF\n";
    EXPECT_TRUE(checker.check(L"/d/a", line, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckWithNullPathOrLineIsFalse) {
    StringList<wchar_t> include, exclude;
    wchar_t line[] = L"/d/a: ELF\n";
    EXPECT_FALSE(checker.check(static_cast<const wchar_t*>(nullptr), line, include, exclude));
    EXPECT_FALSE(checker.check(L"/d/a", static_cast<wchar_t*>(nullptr), include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckNeedsTheLineToBeginWithThePath) {
    StringList<wchar_t> include, exclude;
    fillList(include, {L"ELF"});
    wchar_t line[] = L"/d/b: ELF\n";
    EXPECT_FALSE(checker.check(L"/d/a", line, include, exclude));
    wchar_t good[] = L"/d/a: ELF\n";
    EXPECT_TRUE(checker.check(L"/d/a", good, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckWithEmptyDescriptionIsFalse) {
    StringList<wchar_t> include, exclude;
    fillList(exclude, {L"ELF"});
    wchar_t blanks[] = L"/d/a \t\n";
    EXPECT_FALSE(checker.check(L"/d/a", blanks, include, exclude));
    wchar_t colon[] = L"/d/a:";
    EXPECT_FALSE(checker.check(L"/d/a", colon, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckExcludeWinsOverInclude) {
    StringList<wchar_t> include, exclude;
    fillList(include, {L"text"});
    fillList(exclude, {L"ASCII"});
    wchar_t line[] = L"/d/a: ASCII text\n";
    EXPECT_FALSE(checker.check(L"/d/a", line, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckWithMissedExcludeAndNoIncludeIsTrue) {
    StringList<wchar_t> include, exclude;
    fillList(exclude, {L"ELF"});
    wchar_t line[] = L"/d/a: ASCII text\n";
    EXPECT_TRUE(checker.check(L"/d/a", line, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckIncludeDecidesAfterExclude) {
    StringList<wchar_t> include, exclude;
    fillList(include, {L"script"});
    fillList(exclude, {L"ELF"});
    wchar_t text[] = L"/d/a: ASCII text\n";
    EXPECT_FALSE(checker.check(L"/d/a", text, include, exclude));
    wchar_t script[] = L"/d/a: POSIX shell script, ASCII text executable\n";
    EXPECT_TRUE(checker.check(L"/d/a", script, include, exclude));
}

TEST_F(FileTypeCheckerTest, LineCheckTurnsTabsIntoBlanks) {
    StringList<wchar_t> include, exclude;
    fillList(include, {L"ELF"});
    wchar_t line[] = L"/d/a\tELF\t64-bit\n";
    EXPECT_TRUE(checker.check(L"/d/a", line, include, exclude));
    EXPECT_STREQ(L"/d/a\tELF\t64-bit\n", line);  // the caller's line is not changed
}

TEST_F(FileTypeCheckerTest, LineCheckOnDirAndNameJoinsThem) {
    StringList<wchar_t> include, exclude;
    fillList(include, {L"ELF"});
    wchar_t line[] = L"/d/a: ELF 64-bit\n";
    EXPECT_TRUE(checker.check(L"/d", L"a", line, include, exclude));
    EXPECT_TRUE(checker.check(L"/d/", L"a", line, include, exclude));
    EXPECT_FALSE(checker.check(L"/e", L"a", line, include, exclude));
    EXPECT_FALSE(checker.check(static_cast<const wchar_t*>(nullptr), L"a", line, include, exclude));
}

// ---- runs of `file` --------------------------------------------------------

TEST_F(FileTypeCheckerTest, EmptyTypesListMatchesEveryFileWithoutRunning) {
    StringList<wchar_t> none;
    TraceCapture capture;
    EXPECT_TRUE(checker.check(L"/no/such/dir/file", none));
    EXPECT_TRUE(checker.check(L"/no/such/dir", L"file", none));
    StringList<wchar_t> include, exclude;
    EXPECT_TRUE(checker.check(L"/no/such/dir", L"file", include, exclude));
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, GetFileTypeGivesTheLineOfFile) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    for (const std::string& path : {f.elf, f.script, f.text, f.empty}) {
        wchar_t* line = nullptr;
        ASSERT_TRUE(checker.getFileType(W(path).c_str(), &line)) << path;
        EXPECT_EQ(systemFileLine(path), N(line));
        kelm_free(line);
    }
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, MissingFileCommandEndsAsFalse) {
    TempDir dir;
    std::string path = dir.write("a.txt", "hello\n");
    dir.write("b.txt", "hello\n");
    const char* saved = getenv("PATH");
    std::string savedPath = saved != nullptr ? saved : "";
    // No directory of PATH holds `file`, `ls` or `xargs`: every run prints
    // nothing on its standard output.
    setenv("PATH", dir.file("nothing-here").c_str(), 1);
    wchar_t* line = nullptr;
    bool one = checker.getFileType(W(path).c_str(), &line);
    bool batch = checker.getFileTypeEx(W(path).c_str(), &line);
    StringList<wchar_t> text, include, exclude;
    text.insert(L"text");
    include.insert(L"text");
    bool typed = checker.check(W(dir.file("b.txt")).c_str(), text);
    bool single = checker.check(W(dir.path()).c_str(), L"a.txt", include, exclude);
    if (saved != nullptr) {
        setenv("PATH", savedPath.c_str(), 1);
    } else {
        unsetenv("PATH");
    }
    EXPECT_FALSE(one);
    EXPECT_FALSE(batch);
    EXPECT_FALSE(typed);
    EXPECT_FALSE(single);
    EXPECT_EQ(nullptr, line);
}

TEST_F(FileTypeCheckerTest, GetFileTypeRunsTheOneFileCommand) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    std::string path = dir.write("a.txt", "hello\n");
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileType(W(path).c_str(), &line));
    kelm_free(line);
    EXPECT_TRUE(capture.contains("running 'LANG=C; export LANG; file \"" + path + "\" 2>/dev/null'"))
        << capture.dump();
}

TEST_F(FileTypeCheckerTest, GetFileTypeOfAMissingFileGivesTheCannotOpenLine) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    std::string path = dir.file("missing");
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileType(W(path).c_str(), &line));
    EXPECT_EQ(systemFileLine(path), N(line));
    EXPECT_NE(std::string::npos, N(line).find("cannot open"));
    kelm_free(line);
}

TEST_F(FileTypeCheckerTest, TypeWordsAgreeWithTheFileCommand) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    const std::vector<std::string> kinds = {"ELF", "script", "text", "ASCII", "empty", "executable",
                                            "directory"};
    for (const std::string& path : {f.elf, f.script, f.text, f.empty}) {
        std::set<std::string> words = systemWords(path);
        ASSERT_FALSE(words.empty()) << path;
        for (const std::string& kind : kinds) {
            StringList<wchar_t> types;
            types.insert(W(kind).c_str());
            bool expected = words.count(kind) != 0;
            EXPECT_EQ(expected, checker.check(W(path).c_str(), types)) << path << " / " << kind;
        }
    }
    // What `file` is known to say of these kinds.
    StringList<wchar_t> elf, script, text, empty;
    elf.insert(L"ELF");
    script.insert(L"script");
    text.insert(L"text");
    empty.insert(L"empty");
    EXPECT_TRUE(checker.check(W(f.elf).c_str(), elf));
    EXPECT_TRUE(checker.check(W(f.script).c_str(), script));
    EXPECT_TRUE(checker.check(W(f.text).c_str(), text));
    EXPECT_TRUE(checker.check(W(f.empty).c_str(), empty));
    EXPECT_FALSE(checker.check(W(f.text).c_str(), elf));
    EXPECT_FALSE(checker.check(W(f.empty).c_str(), text));
}

TEST_F(FileTypeCheckerTest, WantedElfOrScriptMatchesEitherKind) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    StringList<wchar_t> wanted;
    wanted.insert(L"ELF, script");
    EXPECT_TRUE(checker.check(W(f.elf).c_str(), wanted));
    EXPECT_TRUE(checker.check(W(f.script).c_str(), wanted));
    EXPECT_FALSE(checker.check(W(f.text).c_str(), wanted));
    EXPECT_FALSE(checker.check(W(f.empty).c_str(), wanted));
}

TEST_F(FileTypeCheckerTest, FirstQuestionClassifiesTheWholeDirectory) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    int batch = FileTypeChecker::currentBatch();
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(f.text).c_str(), &line));
    EXPECT_NE(std::string::npos, N(line).find("ASCII text")) << N(line);
    EXPECT_EQ(0u, N(line).rfind(f.text + ":", 0));
    kelm_free(line);
    EXPECT_EQ(1u, capture.count("running")) << capture.dump();
    EXPECT_TRUE(capture.contains("running 'cd \"" + f.dir.path() +
                                 "\";LANG=C; export LANG; ls | xargs file 2> /dev/null'"))
        << capture.dump();
    EXPECT_EQ(batch % 65536 + 1, FileTypeChecker::currentBatch());
    // The other three answers wait in the cache, tagged with that batch.
    EXPECT_EQ(3u, FileTypeChecker::batchCache().size());
    EXPECT_EQ(batch, FileTypeChecker::batchCache().getLastBatchId());

    // The next question about another file of the directory is served from
    // the cache without a run, and consumes that answer.
    line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(f.empty).c_str(), &line));
    std::string answer = N(line);
    EXPECT_EQ(0u, answer.rfind(f.empty + ":", 0)) << answer;
    ASSERT_GE(answer.size(), 6u);
    EXPECT_EQ("empty\n", answer.substr(answer.size() - 6)) << answer;
    kelm_free(line);
    EXPECT_EQ(1u, capture.count("running")) << capture.dump();
    EXPECT_EQ(2u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, SecondQuestionAboutOneFileRunsTheDirectoryAgain) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    TraceCapture capture;
    wchar_t* first = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(f.elf).c_str(), &first));
    EXPECT_EQ(3u, FileTypeChecker::batchCache().size());
    int batch = FileTypeChecker::currentBatch();
    wchar_t* second = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(f.elf).c_str(), &second));
    EXPECT_STREQ(first, second);
    kelm_free(first);
    kelm_free(second);
    // The answer returned was never cached, so the whole directory ran again
    // and its other three lines went into the cache a second time.
    EXPECT_EQ(2u, capture.count("running")) << capture.dump();
    EXPECT_EQ(batch % 65536 + 1, FileTypeChecker::currentBatch());
    EXPECT_EQ(6u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, CachedAnswerStaysOldUntilAskedOnce) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    std::string a = dir.write("a.txt", "first file\n");
    std::string b = dir.write("b.txt", "second file\n");
    StringList<wchar_t> text, empty;
    text.insert(L"text");
    empty.insert(L"empty");
    EXPECT_TRUE(checker.check(W(a).c_str(), text));
    dir.write("b.txt", "");
    // The answer taken before the change is served once ...
    EXPECT_TRUE(checker.check(W(b).c_str(), text));
    // ... and then the next question runs `file` again.
    EXPECT_TRUE(checker.check(W(b).c_str(), empty));
}

TEST_F(FileTypeCheckerTest, CheckOnDirAndNameGoesThroughTheBatch) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    StringList<wchar_t> elf;
    elf.insert(L"ELF");
    TraceCapture capture;
    EXPECT_TRUE(checker.check(W(f.dir.path()).c_str(), L"prog", elf));
    EXPECT_FALSE(checker.check(W(f.dir.path() + "/").c_str(), L"notes.txt", elf));
    EXPECT_EQ(1u, capture.count("running")) << capture.dump();
    EXPECT_EQ(2u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, CheckWithIncludeAndExcludeRunsTheOneFileCommand) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    exclude.insert(L"script");
    TraceCapture capture;
    EXPECT_TRUE(checker.check(W(f.dir.path()).c_str(), L"notes.txt", include, exclude));
    EXPECT_FALSE(checker.check(W(f.dir.path()).c_str(), L"run.sh", include, exclude));
    EXPECT_FALSE(checker.check(W(f.dir.path()).c_str(), L"nothing", include, exclude));
    EXPECT_EQ(3u, capture.count("running 'LANG=C; export LANG; file \"")) << capture.dump();
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
}

TEST_F(FileTypeCheckerTest, HiddenFilesAreNeverFoundByTheBatch) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    std::string hidden = dir.write(".hidden", "secret words\n");
    dir.write("shown.txt", "plain words\n");
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileTypeEx(W(hidden).c_str(), &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_TRUE(capture.contains("FileTypeChecker::getFileTypeEx - path file name '" + hidden +
                                 "' not found!\n"))
        << capture.dump();
    StringList<wchar_t> text;
    text.insert(L"text");
    EXPECT_FALSE(checker.check(W(hidden).c_str(), text));
    // The one-file command does see it.
    ASSERT_TRUE(checker.getFileType(W(hidden).c_str(), &line));
    EXPECT_NE(std::string::npos, N(line).find("ASCII text"));
    kelm_free(line);
}

TEST_F(FileTypeCheckerTest, GetFileTypeExRefusesPathsWithoutSlashOrTooLong) {
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileTypeEx(L"nofolder", &line));
    std::wstring tooLong = L"/" + std::wstring(4095, L'a');
    ASSERT_EQ(4096u, tooLong.size());
    EXPECT_FALSE(checker.getFileTypeEx(tooLong.c_str(), &line));
    EXPECT_FALSE(checker.getFileTypeEx(nullptr, &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, PathOf4095CharactersIsStillTried) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    std::wstring path = W(dir.path()) + L"/";
    path += std::wstring(4095 - path.size(), L'a');
    ASSERT_EQ(4095u, path.size());
    TraceCapture capture;
    wchar_t* line = nullptr;
    // The name is far beyond what the file system takes, so nothing answers;
    // the point is that the path was not refused for its length.
    EXPECT_FALSE(checker.getFileTypeEx(path.c_str(), &line));
    EXPECT_FALSE(capture.contains("too long")) << capture.dump();
    EXPECT_TRUE(capture.contains("not found!")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, BatchOverTheRootDirectoryUsesSlashAlone) {
    REQUIRE_FILE_COMMAND();
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(L"/tmp", &line));
    EXPECT_EQ(0u, N(line).rfind("/tmp:", 0)) << N(line);
    EXPECT_NE(std::string::npos, N(line).find("directory")) << N(line);
    kelm_free(line);
    EXPECT_TRUE(capture.contains("running 'cd \"/\";LANG=C;")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, BlankInPathIsQuotedForOneFileAndDirectory) {
    REQUIRE_FILE_COMMAND();
    TempDir root;
    std::string dir = root.mkdirs("with blank");
    std::string plain = root.write("with blank/plain.txt", "words\n");
    std::string spaced = root.write("with blank/a b.txt", "words\n");
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileType(W(spaced).c_str(), &line));
    EXPECT_EQ(systemFileLine(spaced), N(line));
    kelm_free(line);
    EXPECT_TRUE(capture.contains("file \"" + spaced + "\" 2>/dev/null")) << capture.dump();

    line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(plain).c_str(), &line));
    EXPECT_NE(std::string::npos, N(line).find("ASCII text"));
    kelm_free(line);
    EXPECT_TRUE(capture.contains("running 'cd \"" + dir + "\";LANG=C;")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, BlankInANameOfTheDirectoryIsSplitByXargs) {
    REQUIRE_FILE_COMMAND();
    TempDir root;
    std::string spaced = root.write("a b.txt", "words\n");
    root.write("other.txt", "words\n");
    wchar_t* line = nullptr;
    // `ls | xargs file` hands "a" and "b.txt" to `file`, so the name with a
    // blank is never answered by the batch.
    EXPECT_FALSE(checker.getFileTypeEx(W(spaced).c_str(), &line));
    EXPECT_EQ(nullptr, line);
}

// ---- a shell that cannot be started ----------------------------------------

namespace {

// Takes every free file descriptor below a lowered limit but leaveFree of
// them, so that a pipe can't be made while it lives.
class DescriptorsExhausted {
public:
    explicit DescriptorsExhausted(int leaveFree) {
        if (getrlimit(RLIMIT_NOFILE, &saved_) != 0) return;
        struct rlimit low = saved_;
        if (low.rlim_cur == RLIM_INFINITY || low.rlim_cur > 256) low.rlim_cur = 256;
        if (setrlimit(RLIMIT_NOFILE, &low) != 0) return;
        lowered_ = true;
        for (;;) {
            int fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
            if (fd < 0) break;
            fillers_.push_back(fd);
        }
        for (int i = 0; i < leaveFree && !fillers_.empty(); ++i) {
            ::close(fillers_.back());
            fillers_.pop_back();
        }
    }
    ~DescriptorsExhausted() { release(); }
    void release() {
        for (int fd : fillers_) ::close(fd);
        fillers_.clear();
        if (lowered_) setrlimit(RLIMIT_NOFILE, &saved_);
        lowered_ = false;
    }
    bool ok() const { return lowered_ && !fillers_.empty(); }

private:
    struct rlimit saved_;
    bool lowered_ = false;
    std::vector<int> fillers_;
};

}  // namespace

TEST_F(FileTypeCheckerTest, ShellThatCannotStartEndsAsFalseWithATrace) {
    TempDir dir;
    std::string a = dir.write("a.txt", "words\n");
    dir.write("b.txt", "words\n");
    StringList<wchar_t> text, include, exclude;
    text.insert(L"text");
    include.insert(L"text");
    TraceCapture capture;
    wchar_t* one = nullptr;
    wchar_t* batch = nullptr;
    bool oneResult, batchResult, typedResult, singleResult;
    {
        DescriptorsExhausted exhausted(0);
        ASSERT_TRUE(exhausted.ok());
        oneResult = checker.getFileType(W(a).c_str(), &one);
        singleResult = checker.check(W(dir.path()).c_str(), L"a.txt", include, exclude);
    }
    {
        // The batch opens its directory first: one descriptor for that.
        DescriptorsExhausted exhausted(1);
        ASSERT_TRUE(exhausted.ok());
        batchResult = checker.getFileTypeEx(W(a).c_str(), &batch);
        typedResult = checker.check(W(dir.file("b.txt")).c_str(), text);
    }
    EXPECT_FALSE(oneResult);
    EXPECT_FALSE(batchResult);
    EXPECT_FALSE(typedResult);
    EXPECT_FALSE(singleResult);
    EXPECT_EQ(nullptr, one);
    EXPECT_EQ(nullptr, batch);
    EXPECT_TRUE(capture.contains("FileTypeChecker::check - cannot open 'LANG=C; export LANG; file \"" + a +
                                 "\" 2>/dev/null' cmd file!\n"))
        << capture.dump();
    EXPECT_TRUE(capture.contains("FileTypeChecker::check - cannot open 'cd \"" + dir.path() +
                                 "\";LANG=C; export LANG; ls | xargs file 2> /dev/null' cmd file!\n"))
        << capture.dump();
    EXPECT_EQ(4u, capture.count("' cmd file!\n")) << capture.dump();
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
}

// Out of memory for the command text: nothing runs, the answer is false and
// the trace says why.  The check by directory and name fails one step
// earlier, on the copy of the full path, and runs nothing either.
TEST_F(FileTypeCheckerTest, CommandTextThatCannotBeAllocatedEndsAsFalseWithATrace) {
    TempDir dir;
    std::string a = dir.write("a.txt", "words\n");
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    TraceCapture capture;
    wchar_t* one = nullptr;
    kelm_failAfter(0);
    bool oneResult = checker.getFileType(W(a).c_str(), &one);
    bool singleResult = checker.check(W(dir.path()).c_str(), L"a.txt", include, exclude);
    kelm_failAfter(-1);
    EXPECT_FALSE(oneResult);
    EXPECT_FALSE(singleResult);
    EXPECT_EQ(nullptr, one);
    EXPECT_EQ(1u, capture.count("FileTypeChecker::check - 'cmd' malloc failed!\n")) << capture.dump();
    EXPECT_FALSE(capture.contains("running '")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, ListCheckWhoseShellCannotStartGivesNoResult) {
    TempDir work;
    std::string list = work.write("paths", work.path() + "/x\n");
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    std::vector<bool> results;
    TraceCapture capture;
    int count;
    {
        // One descriptor for the list file, none for the pipe.
        DescriptorsExhausted exhausted(1);
        ASSERT_TRUE(exhausted.ok());
        count = checker.check(W(list).c_str(), include, exclude, results);
    }
    EXPECT_EQ(-1, count);
    EXPECT_TRUE(results.empty());
    EXPECT_TRUE(capture.contains("FileTypeChecker::check - cannot open 'LANG=C; export LANG; file -f " + list +
                                 " 2>/dev/null' cmd file!\n"))
        << capture.dump();
}

// ---- the list file ---------------------------------------------------------

TEST_F(FileTypeCheckerTest, MakeListFileWritesEveryEntryThatIsNotADirectory) {
    TempDir dir;
    TempDir out;
    dir.write("a.txt", "a");
    dir.write(".profile", "p");
    dir.write("..x", "x");
    dir.mkdirs("sub");
    ASSERT_EQ(0, symlink((dir.path() + "/sub").c_str(), (dir.path() + "/link").c_str()));
    std::string list = out.file("list");
    EXPECT_EQ(4, checker.makeListFile(dir.path().c_str(), list.c_str()));
    std::istringstream lines(testsupport::readFile(list));
    std::vector<std::string> got;
    for (std::string l; std::getline(lines, l);) got.push_back(l);
    std::sort(got.begin(), got.end());
    std::vector<std::string> expected = {dir.path() + "/..x", dir.path() + "/.profile",
                                         dir.path() + "/a.txt", dir.path() + "/link"};
    EXPECT_EQ(expected, got);
}

TEST_F(FileTypeCheckerTest, MakeListFileOfAnEmptyDirectoryWritesNothing) {
    TempDir dir;
    TempDir out;
    dir.mkdirs("only_a_dir");
    std::string list = out.file("list");
    EXPECT_EQ(0, checker.makeListFile(dir.path().c_str(), list.c_str()));
    EXPECT_TRUE(testsupport::fileExists(list));
    EXPECT_EQ("", testsupport::readFile(list));
}

TEST_F(FileTypeCheckerTest, MakeListFileFailsOnMissingDirectoryOrUnwritableList) {
    TempDir dir;
    dir.write("a", "a");
    EXPECT_EQ(-1, checker.makeListFile(dir.file("missing").c_str(), dir.file("list").c_str()));
    EXPECT_EQ(-1, checker.makeListFile(dir.path().c_str(), dir.file("no/such/list").c_str()));
    EXPECT_EQ(-1, checker.makeListFile(nullptr, dir.file("list").c_str()));
    EXPECT_EQ(-1, checker.makeListFile(dir.path().c_str(), nullptr));
}

TEST_F(FileTypeCheckerTest, MakeListFileFailsWhenAnEntryCannotBeStated) {
    // A directory whose own path fits the system's limit but whose entry's
    // full path does not: opendir works, lstat on the entry fails.
    TempDir root;
    TempDir out;
    std::string dir = root.path();
    while (dir.size() < 3880) {
        size_t length = std::min<size_t>(200, 3880 - dir.size());
        dir += "/" + std::string(length, 'd');
        ASSERT_EQ(0, mkdir(dir.c_str(), 0755)) << dir.size();
    }
    std::string name(250, 'n');
    int fd = open(dir.c_str(), O_RDONLY | O_DIRECTORY);
    ASSERT_GE(fd, 0);
    int file = openat(fd, name.c_str(), O_CREAT | O_WRONLY, 0644);
    ASSERT_GE(file, 0);
    close(file);
    close(fd);
    TraceCapture capture;
    EXPECT_EQ(-1, checker.makeListFile(dir.c_str(), out.file("list").c_str()));
    EXPECT_TRUE(capture.contains("::makeListFile - stat on '" + dir + "/" + name + "' file failed!\n"))
        << capture.dump().substr(0, 300);
}

TEST_F(FileTypeCheckerTest, GetFileTypeEx2ClassifiesThroughTheListFile) {
    REQUIRE_FILE_COMMAND();
    TempDir work;
    KindsFixture f;
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx_2(W(f.script).c_str(), &line));
    EXPECT_EQ(squeeze(systemFileLine(f.script)), squeeze(N(line)));
    kelm_free(line);
    std::string listName = std::string(checker.getListFileName()).substr(2);
    EXPECT_TRUE(capture.contains("running 'LANG=C; export LANG; file -f " +
                                 std::string(checker.getListFileName()) + " 2>/dev/null'"))
        << capture.dump();
    // The list file stays behind in the working directory.
    std::string listed = testsupport::readFile(work.file(listName));
    EXPECT_NE(std::string::npos, listed.find(f.elf + "\n"));
    EXPECT_NE(std::string::npos, listed.find(f.script + "\n"));
    EXPECT_EQ(3u, FileTypeChecker::listCache().size());
    EXPECT_EQ(0u, FileTypeChecker::batchCache().size());
    // The others come from its own cache.
    line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx_2(W(f.empty).c_str(), &line));
    EXPECT_EQ(squeeze(systemFileLine(f.empty)), squeeze(N(line)));
    kelm_free(line);
    EXPECT_EQ(1u, capture.count("running")) << capture.dump();
    EXPECT_EQ(2u, FileTypeChecker::listCache().size());
}

TEST_F(FileTypeCheckerTest, GetFileTypeEx2OfADirectoryWithOneEntryRunsTheOneFileCommand) {
    REQUIRE_FILE_COMMAND();
    TempDir work;
    TempDir dir;
    std::string only = dir.write("only.txt", "alone\n");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx_2(W(only).c_str(), &line));
    EXPECT_EQ(systemFileLine(only), N(line));
    kelm_free(line);
    EXPECT_TRUE(capture.contains("running 'LANG=C; export LANG; file \"" + only + "\" 2>/dev/null'"))
        << capture.dump();
}

TEST_F(FileTypeCheckerTest, GetFileTypeEx2OfAnEmptyOrMissingDirectoryIsFalse) {
    TempDir work;
    TempDir dir;
    dir.mkdirs("sub");
    WorkingDirectory cwd(work.path());
    ASSERT_TRUE(cwd.ok());
    TraceCapture capture;
    wchar_t* line = nullptr;
    EXPECT_FALSE(checker.getFileTypeEx_2(W(dir.file("ghost")).c_str(), &line));
    EXPECT_FALSE(checker.getFileTypeEx_2(W(dir.file("missing/ghost")).c_str(), &line));
    EXPECT_EQ(nullptr, line);
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, ListCheckGivesOneResultPerListedPath) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    TempDir work;
    std::string list = work.write("paths", f.elf + "\n" + f.script + "\n" + f.text + "\n" + f.empty + "\n");
    StringList<wchar_t> include, exclude;
    include.insert(L"text, ELF");
    exclude.insert(L"script");
    std::vector<bool> results;
    results.push_back(true);  // appended to, not replaced
    TraceCapture capture;
    EXPECT_EQ(4, checker.check(W(list).c_str(), include, exclude, results));
    std::vector<bool> expected = {true, true, false, true, false};
    EXPECT_EQ(expected, results);
    EXPECT_TRUE(capture.contains("running 'LANG=C; export LANG; file -f " + list + " 2>/dev/null'"))
        << capture.dump();
}

TEST_F(FileTypeCheckerTest, ListCheckTrimsTheListLine) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    TempDir work;
    // `file -f` keeps the trailing blank as part of the name, can't open it
    // and says so on a line that begins with the blank-ended name.  Only the
    // trimmed list line is a prefix of that line.
    std::string list = work.write("paths", f.text + " \n");
    StringList<wchar_t> include, exclude;
    include.insert(L"cannot");
    std::vector<bool> results;
    EXPECT_EQ(1, checker.check(W(list).c_str(), include, exclude, results));
    ASSERT_EQ(1u, results.size());
    EXPECT_TRUE(results[0]);
}

TEST_F(FileTypeCheckerTest, ListCheckOfAnEmptyListGivesNoResult) {
    REQUIRE_FILE_COMMAND();
    TempDir work;
    std::string none = work.write("none", "");
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    std::vector<bool> results;
    EXPECT_EQ(0, checker.check(W(none).c_str(), include, exclude, results));
    EXPECT_TRUE(results.empty());
}

TEST_F(FileTypeCheckerTest, ListCheckWithBothListsEmptyGivesZeroWithoutRunning) {
    StringList<wchar_t> include, exclude;
    std::vector<bool> results;
    TraceCapture capture;
    EXPECT_EQ(0, checker.check(L"/no/such/list", include, exclude, results));
    EXPECT_TRUE(results.empty());
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, ListCheckRefusesANullName) {
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    std::vector<bool> results;
    TraceCapture capture;
    EXPECT_EQ(-1, checker.check(static_cast<const wchar_t*>(nullptr), include, exclude, results));
    EXPECT_TRUE(capture.contains("FileTypeChecker::check - pathFileName is a null pointer!\n"))
        << capture.dump();
}

TEST_F(FileTypeCheckerTest, ListCheckOfAMissingListFileTracesIt) {
    TempDir work;
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    std::vector<bool> results;
    TraceCapture capture;
    std::string missing = work.file("missing");
    EXPECT_EQ(-1, checker.check(W(missing).c_str(), include, exclude, results));
    EXPECT_TRUE(capture.contains("FileTypeChecker::check - cannot open '" + missing + "' data file!\n"))
        << capture.dump();
    EXPECT_EQ(0u, capture.count("running")) << capture.dump();
}

TEST_F(FileTypeCheckerTest, BlankInTheListFileNameStandsBareAndSplitsIt) {
    REQUIRE_FILE_COMMAND();
    KindsFixture f;
    TempDir work;
    std::string list = work.write("my list", f.text + "\n");
    work.write("my", f.elf + "\n");
    StringList<wchar_t> include, exclude;
    include.insert(L"text");
    std::vector<bool> results;
    TraceCapture capture;
    // The bare name becomes two words: `file` reads the list "my" (the ELF
    // binary) and then also classifies "list", a name that does not exist.
    // The first output line, about the ELF binary, is paired with the first
    // line of "my list"; the list then ends before the output does.
    EXPECT_EQ(1, checker.check(W(list).c_str(), include, exclude, results));
    EXPECT_TRUE(capture.contains("running 'LANG=C; export LANG; file -f " + list + " 2>/dev/null'"))
        << capture.dump();
    ASSERT_EQ(1u, results.size());
    EXPECT_FALSE(results[0]);
}

TEST_F(FileTypeCheckerTest, BigDirectoryIsReadWholeBeyondTheCacheCapacity) {
    REQUIRE_FILE_COMMAND();
    TempDir dir;
    for (int i = 0; i < 4200; ++i) {
        std::ofstream(dir.file("f" + std::to_string(i))).close();
    }
    TraceCapture capture;
    wchar_t* line = nullptr;
    ASSERT_TRUE(checker.getFileTypeEx(W(dir.file("f0")).c_str(), &line));
    kelm_free(line);
    EXPECT_EQ(4199u, FileTypeChecker::batchCache().size());
    // Every other answer is there, even beyond capacity: no second run.
    for (int i : {1, 2000, 4199}) {
        line = nullptr;
        ASSERT_TRUE(checker.getFileTypeEx(W(dir.file("f" + std::to_string(i))).c_str(), &line)) << i;
        EXPECT_NE(std::string::npos, N(line).find("empty")) << N(line);
        kelm_free(line);
    }
    EXPECT_EQ(1u, capture.count("running")) << capture.dump();
    EXPECT_EQ(4196u, FileTypeChecker::batchCache().size());

    // The next batch finds the cache full and drops that whole batch.
    TempDir small;
    std::string a = small.write("a", "");
    small.write("b", "");
    ASSERT_TRUE(checker.getFileTypeEx(W(a).c_str(), &line));
    kelm_free(line);
    EXPECT_EQ(1u, FileTypeChecker::batchCache().size());
}

}  // namespace
