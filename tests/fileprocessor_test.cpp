// The criteria stage of the direct walk: the columns a file is seen through,
// the path and type commands, the known-checksum set, and whole walks whose
// expected hits follow from how the fixture was built.
#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <cstdlib>
#include <set>
#include <string>
#include <vector>

#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_resultset.h"
#include "fscanner/fscommon/checksum.h"
#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/filehash.h"
#include "fscanner/fscommon/fileprocessor.h"
#include "fscanner/fscommon/fsbuild.h"
#include "fscanner/fscommon/utils.h"
#include "support/testsupport.h"

using testsupport::TempDir;
using testsupport::TraceCapture;

namespace {

const int kBudget = 2000000000;

// Literal sums of the fixture contents.
const unsigned int kCrc32OfAbc = 0x352441c2u;
const unsigned int kCrc32OfDef = 0x0cc4e161u;
const char kMd5OfAbc[] = "900150983cd24fb0d6963f7d28e17f72";

std::wstring wide(const std::string& text) {
    wchar_t* w = utils::myMbsToWcsString(text.c_str());
    std::wstring out(w);
    delete[] w;
    return out;
}

std::string narrow(const wchar_t* text) {
    char* n = utils::myWcsToMbsString(text);
    std::string out(n);
    delete[] n;
    return out;
}

// A record built by hand: nothing is read from the disk for it.
FsFileInfo fileRecord(const wchar_t* path, const wchar_t* name, unsigned long long size,
                      unsigned int attr) {
    FsFileInfo info;
    info.setFilePath(path);
    info.setFileName(name);
    info.setFileSize(size);
    info.setFileAttr(attr);
    return info;
}

FileChecksumInfo sums(uint32_t flags, uint32_t crc32, uint32_t q32) {
    FileChecksumInfo c;
    c.valid = true;
    c.flags = flags;
    c.crc32 = crc32;
    c.q32 = q32;
    return c;
}

bool fileCommandPresent() {
    int status = -1;
    testsupport::runCommand("command -v file >/dev/null 2>&1", &status);
    return status == 0;
}

// Collects what the walk writes, as paths relative to a root.
class RecordingWriter : public FsResultSetWriter {
public:
    explicit RecordingWriter(const std::string& root) : prefix(root + "/") {}
    int addRecord(const wchar_t*, const wchar_t*, unsigned long long, unsigned int, const wchar_t*,
                  unsigned int, unsigned int) override {
        return -1;
    }
    int addRecord(const FsFileInfo& info) override {
        std::string full = narrow(info.getPath()) + narrow(info.getName());
        hits.insert(full.compare(0, prefix.size(), prefix) == 0 ? full.substr(prefix.size()) : full);
        ++count;
        return 0;
    }
    int close() override { return 0; }

    std::string prefix;
    std::set<std::string> hits;
    int count = 0;
};

// Walks root recursively with processor; the relative paths written.
std::set<std::string> walk(FileProcessor& processor, const std::string& root, int* result = nullptr) {
    RecordingWriter writer(root);
    std::vector<PathInfo> includes, excludes;
    PathDrive drive(wide(root).c_str(), true, DriveInfo(L"/:", dtLocal, L"ext4"));
    int r = fs_build(writer, processor, drive, includes, excludes, true, kBudget);
    if (result != nullptr) *result = r;
    EXPECT_EQ(static_cast<size_t>(writer.count), writer.hits.size()) << "a file was written twice";
    return writer.hits;
}

std::set<std::string> query(const std::string& root, const std::wstring& expression) {
    FileProcessor processor(expression.c_str(), true);
    return walk(processor, root);
}

// The fixture of the walks.  Contents and modes are set explicitly, so the
// files each expression must find follow from this constructor alone.
struct Fixture {
    TempDir dir;
    std::string root;
    Fixture() {
        root = dir.path();
        put("docs/readme.txt", "hello world\n", 0644);    // 12 bytes, text
        put("docs/notes.md", "x", 0644);                  // 1 byte
        put("bin/run.sh", "#!/bin/sh\necho hi\n", 0755);  // the only script, the only executable
        put("bin/tool.bin", std::string("\x00\x01\x02\xff\xfe", 5), 0644);
        put("data/big.dat", std::string(5000, 'a'), 0644);
        put("data/empty.dat", "", 0644);                  // the only empty file
        put("data/sub/deep.txt", "deep", 0644);           // 4 bytes
    }
    void put(const std::string& relative, const std::string& content, mode_t mode) {
        std::string full = dir.write(relative, content);
        chmod(full.c_str(), mode);
    }
};

}  // namespace

// ------------------------------------------------------------ construction

TEST(FileProcessor, ColumnsStandInTheirOrderWithTheirKinds) {
    FileProcessor processor(L"1==1", true);
    ASSERT_EQ(processor.fields.count(), 8u);
    const wchar_t* names[] = {L"FILENAME", L"SHORTFILENAME", L"SIZE", L"ATTR",
                              L"PATHID",   L"MD5",           L"CRC32", L"Q32"};
    unsigned int kinds[] = {5, 5, 4, 3, 3, 5, 3, 3};
    for (unsigned int i = 0; i < 8; ++i) {
        EXPECT_STREQ(processor.fields.at(i)->getName(), names[i]) << i;
        EXPECT_EQ(processor.fields.at(i)->getType(), kinds[i]) << i;
    }
}

TEST(FileProcessor, TwoArgumentConstructorAsksForNoChecksumAndHoldsNoSet) {
    FileProcessor processor(L"1==1", false);
    EXPECT_EQ(processor.processingFlags, 0x1fu);
    EXPECT_EQ(processor.hashes, nullptr);
    EXPECT_FALSE(processor.caseSensitive);
    ASSERT_NE(processor.evaluator, nullptr);
    EXPECT_TRUE(processor.evaluator->isValid());
    EXPECT_NE(processor.typeCommand, nullptr);
    EXPECT_NE(processor.pathCommand, nullptr);
}

TEST(FileProcessor, FourArgumentConstructorKeepsFlagsAndSet) {
    FileHashBlackBox known;
    FileProcessor processor(L"1==1", true, 0xe0, &known);
    EXPECT_EQ(processor.processingFlags, 0xe0u);
    EXPECT_EQ(processor.hashes, &known);
    EXPECT_TRUE(processor.caseSensitive);
}

TEST(FileProcessor, CommandsAreRegisteredWithTheirArgumentTypes) {
    FileProcessor processor(L"1==1", true);
    EXPECT_TRUE(processor.evaluator->findCmd(L"path", 0, 1));
    EXPECT_FALSE(processor.evaluator->findCmd(L"path", 1, 1));
    EXPECT_TRUE(processor.evaluator->findCmd(L"type", 1, 1));
    EXPECT_FALSE(processor.evaluator->findCmd(L"type", 0, 1));
}

// ------------------------------------------------------------ satisfyCriteria

TEST(FileProcessor, NullCriteriaAnswersFalseForEveryFileWhateverTheKnownSet) {
    FileHashBlackBox known;
    known.insert_crc32(kCrc32OfAbc);
    FileProcessor processor(nullptr, true, 0x40, &known);
    EXPECT_FALSE(processor.evaluator->isValid());
    FileChecksumInfo abc = sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0);
    // The set alone would accept this file.
    ASSERT_TRUE(known.find(abc));
    FsFileInfo a = fileRecord(L"/d/", L"abc", 3, 0x2000);
    FsFileInfo b = fileRecord(L"/d/", L"x", 0, 0x2000);
    EXPECT_FALSE(processor.satisfyCriteria(a, abc, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(b, abc, L"X"));
    FileProcessor noSet(nullptr, true);
    EXPECT_FALSE(noSet.satisfyCriteria(a, abc, nullptr));
}

TEST(FileProcessor, EmptyOrBrokenExpressionAnswersFalse) {
    FsFileInfo a = fileRecord(L"/d/", L"a", 1, 0x2000);
    FileChecksumInfo none;
    FileProcessor empty(L"", true);
    EXPECT_FALSE(empty.satisfyCriteria(a, none, nullptr));
    FileProcessor unknownColumn(L"[NOSUCH]==1", true);
    EXPECT_FALSE(unknownColumn.satisfyCriteria(a, none, nullptr));
    FileProcessor unclosed(L"([SIZE]==1", true);
    EXPECT_FALSE(unclosed.satisfyCriteria(a, none, nullptr));
}

TEST(FileProcessor, Md5ColumnIsTheTextZeroAndCrcColumnsAreZeroWhateverWasComputed) {
    FileChecksumInfo computed = sums(FILE_CHECKSUM_CRC32 | FILE_CHECKSUM_Q32 | FILE_CHECKSUM_MD5,
                                     kCrc32OfAbc, 0x12345678u);
    computed.md5 = char2md5(kMd5OfAbc);
    FsFileInfo a = fileRecord(L"/d/", L"abc", 3, 0x2000);
    FsFileInfo b = fileRecord(L"/e/", L"def", 3, 0x2000);
    FileChecksumInfo none;

    FileProcessor md5(L"[MD5]==\"0\"", true);
    EXPECT_TRUE(md5.satisfyCriteria(a, computed, nullptr));
    EXPECT_TRUE(md5.satisfyCriteria(b, none, nullptr));
    FileProcessor md5Real(L"[MD5]==\"900150983cd24fb0d6963f7d28e17f72\"", true);
    EXPECT_FALSE(md5Real.satisfyCriteria(a, computed, nullptr));

    FileProcessor crc(L"[CRC32]==0", true);
    EXPECT_TRUE(crc.satisfyCriteria(a, computed, nullptr));
    EXPECT_TRUE(crc.satisfyCriteria(b, none, nullptr));
    FileProcessor crcReal(L"[CRC32]==891568578", true);  // 0x352441c2
    EXPECT_FALSE(crcReal.satisfyCriteria(a, computed, nullptr));

    FileProcessor q32(L"[Q32]==0", true);
    EXPECT_TRUE(q32.satisfyCriteria(a, computed, nullptr));
}

TEST(FileProcessor, PathIdReadsZero) {
    FsFileInfo a = fileRecord(L"/d/", L"a", 7, 0x2000);
    FileChecksumInfo none;
    FileProcessor equalsZero(L"[PATHID]==0", true);
    EXPECT_TRUE(equalsZero.satisfyCriteria(a, none, nullptr));
    FileProcessor notZero(L"[PATHID]!=0", true);
    EXPECT_FALSE(notZero.satisfyCriteria(a, none, nullptr));
    // The bare column evaluates to 0, which is not a match.
    FileProcessor bare(L"[PATHID]", true);
    EXPECT_FALSE(bare.satisfyCriteria(a, none, nullptr));
    EXPECT_EQ(bare.evaluator->check(true), 0);
}

TEST(FileProcessor, NameSizeAndAttributesAreThoseOfTheOfferedFile) {
    FileChecksumInfo none;
    FileProcessor processor(L"[FILENAME]==\"*.txt\" && [SIZE]>=10 && ([ATTR]&8)==8", true);
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/d/", L"a.txt", 10, 0x200a), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/d/", L"a.txt", 9, 0x200a), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/d/", L"a.bin", 10, 0x200a), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/d/", L"a.txt", 10, 0x2002), none, nullptr));
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/d/", L"b.txt", 5000000000ull, 0x2008), none,
                                          nullptr));
}

TEST(FileProcessor, OnlyAResultOfExactlyOneIsAMatch) {
    FileChecksumInfo none;
    FileProcessor processor(L"[SIZE]", true);
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/d/", L"a", 1, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/d/", L"a", 2, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/d/", L"a", 0, 0x2000), none, nullptr));
    // The low 32 bits decide: 2^32 + 1 counts as 1.
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/d/", L"a", 0x100000001ull, 0x2000), none,
                                          nullptr));
}

TEST(FileProcessor, CaseFlagGovernsTextComparisons) {
    FileChecksumInfo none;
    FsFileInfo upper = fileRecord(L"/d/", L"README.TXT", 1, 0x2000);
    FileProcessor sensitive(L"[FILENAME]==\"readme.txt\"", true);
    FileProcessor insensitive(L"[FILENAME]==\"readme.txt\"", false);
    EXPECT_FALSE(sensitive.satisfyCriteria(upper, none, nullptr));
    EXPECT_TRUE(insensitive.satisfyCriteria(upper, none, nullptr));
    FileProcessor mask(L"[FILENAME]==\"*.txt\"", false);
    EXPECT_TRUE(mask.satisfyCriteria(upper, none, nullptr));
}

TEST(FileProcessor, ShortNameIsStoredOnlyWhenGiven) {
    FileChecksumInfo none;
    FsFileInfo a = fileRecord(L"/d/", L"averylongname.text", 1, 0x2000);
    FileProcessor processor(L"[SHORTFILENAME]==\"AVERYL~1.TEX\"", true);
    FileProcessor blank(L"[SHORTFILENAME]==\"\"", true);
    // Nothing stored yet: the column reads empty.
    EXPECT_TRUE(blank.satisfyCriteria(a, none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(a, none, nullptr));
    EXPECT_TRUE(processor.satisfyCriteria(a, none, L"AVERYL~1.TEX"));
    // A null short name leaves what the previous file stored.
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/d/", L"other", 1, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(a, none, L"OTHER"));
}

TEST(FileProcessor, KnownSetDecidesOnceTheExpressionHolds) {
    FileHashBlackBox known;
    known.insert_crc32(kCrc32OfAbc);
    known.insert_md5(char2md5(kMd5OfAbc));
    FsFileInfo a = fileRecord(L"/d/", L"a", 3, 0x2000);
    FileProcessor every(L"[SIZE]>=0", true, 0x40, &known);
    EXPECT_TRUE(every.satisfyCriteria(a, sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0), nullptr));
    EXPECT_FALSE(every.satisfyCriteria(a, sums(FILE_CHECKSUM_CRC32, kCrc32OfDef, 0), nullptr));
    // Only the sums the flags mark are looked at.
    EXPECT_FALSE(every.satisfyCriteria(a, sums(FILE_CHECKSUM_Q32, kCrc32OfAbc, 0), nullptr));
    EXPECT_FALSE(every.satisfyCriteria(a, sums(0, kCrc32OfAbc, 0), nullptr));
    FileChecksumInfo md5 = sums(FILE_CHECKSUM_MD5, 0, 0);
    md5.md5 = char2md5(kMd5OfAbc);
    EXPECT_TRUE(every.satisfyCriteria(a, md5, nullptr));

    // The expression comes first: a matching sum does not rescue a miss.
    FileProcessor none(L"[SIZE]>3", true, 0x40, &known);
    EXPECT_FALSE(none.satisfyCriteria(a, sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0), nullptr));
}

TEST(FileProcessor, EmptyKnownSetRejectsEveryFile) {
    FileHashBlackBox known;
    FileProcessor processor(L"[SIZE]>=0", true, 0x40, &known);
    FsFileInfo a = fileRecord(L"/d/", L"a", 3, 0x2000);
    EXPECT_FALSE(processor.satisfyCriteria(a, sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0), nullptr));
}

TEST(FileProcessor, DestructorLeavesTheKnownSetToItsOwner) {
    FileHashBlackBox known;
    known.insert_crc32(kCrc32OfAbc);
    {
        FileProcessor processor(L"[SIZE]>=0", true, 0x40, &known);
        FsFileInfo a = fileRecord(L"/d/", L"a", 3, 0x2000);
        EXPECT_TRUE(processor.satisfyCriteria(a, sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0), nullptr));
    }
    EXPECT_EQ(known.size(), 1u);
    EXPECT_TRUE(known.find(sums(FILE_CHECKSUM_CRC32, kCrc32OfAbc, 0)));
}

TEST(FileProcessor, NewestProcessorOwnsTheCommandTable) {
    FileChecksumInfo none;
    FsFileInfo a = fileRecord(L"/d/", L"a", 3, 0x2000);
    FileProcessor first(L"path(0,\"\")==\"/d/a\"", true);
    EXPECT_TRUE(first.satisfyCriteria(a, none, nullptr));
    // A second expression in the process empties the table of commands: the
    // first processor's parsed tree still names them, and now fails.
    FileProcessor second(L"path(0,\"\")==\"/d/a\"", true);
    EXPECT_TRUE(second.satisfyCriteria(a, none, nullptr));
    EXPECT_FALSE(first.satisfyCriteria(a, none, nullptr));
}

// ------------------------------------------------------------ path command

TEST(FpPathCommand, GivesTheFullPathOfTheCurrentFileAndIgnoresItsArguments) {
    fpPathCommand command;
    ExpValue number, text, result;
    number.setNumericValue(12);
    text.setString(L"anything");
    result.setNumericValue(5);
    EXPECT_EQ(command.execute(number, text, result), 0);
    EXPECT_TRUE(result.isString());
    EXPECT_STREQ(result.getStringValue(), L"");

    FsFileInfo withSeparator = fileRecord(L"/data/dir/", L"file.txt", 1, 0x2000);
    command.setFsFileInfo(&withSeparator);
    EXPECT_EQ(command.execute(number, text, result), 0);
    EXPECT_TRUE(result.isString());
    EXPECT_STREQ(result.getStringValue(), L"/data/dir/file.txt");

    FsFileInfo withoutSeparator = fileRecord(L"/data/dir", L"file.txt", 1, 0x2000);
    command.setFsFileInfo(&withoutSeparator);
    EXPECT_EQ(command.execute(number, text, result), 0);
    EXPECT_STREQ(result.getStringValue(), L"/data/dir/file.txt");

    // A path longer than the inline text of a value.
    std::wstring longDir = L"/" + std::wstring(300, L'd') + L"/";
    FsFileInfo deep = fileRecord(longDir.c_str(), L"f", 1, 0x2000);
    command.setFsFileInfo(&deep);
    EXPECT_EQ(command.execute(number, text, result), 0);
    EXPECT_EQ(std::wstring(result.getStringValue()), longDir + L"f");
}

TEST(FpPathCommand, ExpressionSeesTheOfferedFileAndOnlyWhileItIsOffered) {
    FileChecksumInfo none;
    FileProcessor processor(L"path(7,\"ignored\")==\"/srv/*/x.log\"", true);
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(L"/srv/a/", L"x.log", 1, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/srv/a/", L"y.log", 1, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(L"/tmp/", L"x.log", 1, 0x2000), none, nullptr));
    // After the answer the command no longer points at the caller's record.
    EXPECT_EQ(processor.pathCommand->getFsFileInfo(), nullptr);
}

// ------------------------------------------------------------ type command

TEST(FpTypeCommand, AnswersOneForAWantedWordAndZeroOtherwise) {
    if (!fileCommandPresent()) GTEST_SKIP() << "the file command is not installed";
    TempDir dir;
    std::string script = dir.write("run.sh", "#!/bin/sh\necho hi\n");
    std::string text = dir.write("notes.txt", "hello world\n");
    fpTypeCommand command;
    ExpValue path, wanted, result;
    path.setString(wide(script).c_str());

    wanted.setString(L"script");
    result.setString(L"left over");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_TRUE(result.isNumeric());
    EXPECT_EQ(result.getNumber(), 1u);

    wanted.setString(L"ELF");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_EQ(result.getNumber(), 0u);

    // A wanted entry of several words means any of them.
    wanted.setString(L"ELF, script");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_EQ(result.getNumber(), 1u);

    path.setString(wide(text).c_str());
    wanted.setString(L"script");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_EQ(result.getNumber(), 0u);
    wanted.setString(L"text");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_EQ(result.getNumber(), 1u);
}

TEST(FpTypeCommand, FileThatCannotBeClassifiedIsNotOfTheType) {
    TempDir dir;
    fpTypeCommand command;
    ExpValue path, wanted, result;
    wanted.setString(L"data");
    path.setString(wide(dir.path() + "/missing").c_str());
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_TRUE(result.isNumeric());
    EXPECT_EQ(result.getNumber(), 0u);
    // No directory part at all.
    path.setString(L"bare");
    EXPECT_EQ(command.execute(path, wanted, result), 0);
    EXPECT_EQ(result.getNumber(), 0u);
}

TEST(FpTypeCommand, InExpressionsOfTheWalkThroughThePathCommand) {
    if (!fileCommandPresent()) GTEST_SKIP() << "the file command is not installed";
    TempDir dir;
    dir.write("run.sh", "#!/bin/sh\necho hi\n");
    dir.write("notes.txt", "hello world\n");
    FileChecksumInfo none;
    FileProcessor processor(L"type(path(0,\"\"),\"script\")==1", true);
    std::wstring where = wide(dir.path() + "/");
    EXPECT_TRUE(processor.satisfyCriteria(fileRecord(where.c_str(), L"run.sh", 18, 0x2000), none, nullptr));
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(where.c_str(), L"notes.txt", 12, 0x2000), none,
                                           nullptr));
}

// ------------------------------------------------------------ whole walks

TEST(FileProcessorWalk, NameSizeAttributeAndPathExpressionsFindTheFilesBuiltForThem) {
    Fixture f;
    typedef std::set<std::string> Names;
    EXPECT_EQ(query(f.root, L"[FILENAME]==\"*.txt\""), (Names{"docs/readme.txt", "data/sub/deep.txt"}));
    EXPECT_EQ(query(f.root, L"[SIZE]>100"), (Names{"data/big.dat"}));
    EXPECT_EQ(query(f.root, L"[SIZE]==0"), (Names{"data/empty.dat"}));
    EXPECT_EQ(query(f.root, L"([ATTR]&8)==8"), (Names{"bin/run.sh"}));
    EXPECT_EQ(query(f.root, L"[FILENAME]==\"*.txt\" && [SIZE]>4"), (Names{"docs/readme.txt"}));
    EXPECT_EQ(query(f.root, L"[SIZE]==1 || [FILENAME]==\"tool.*\""),
              (Names{"docs/notes.md", "bin/tool.bin"}));
    EXPECT_EQ(query(f.root, L"path(0,\"\")==\"*/data/*\""),
              (Names{"data/big.dat", "data/empty.dat", "data/sub/deep.txt"}));
    EXPECT_EQ(query(f.root, wide("path(0,\"\")==\"" + f.root + "/bin/tool.bin\"")), (Names{"bin/tool.bin"}));
    EXPECT_EQ(query(f.root, L"[MD5]==\"0\" && [CRC32]==0 && [PATHID]==0").size(), 7u);
    EXPECT_TRUE(query(f.root, L"[FILENAME]==\"nothing-is-called-this\"").empty());
}

TEST(FileProcessorWalk, TypeExpressionFindsTheFilesBuiltForIt) {
    if (!fileCommandPresent()) GTEST_SKIP() << "the file command is not installed";
    Fixture f;
    typedef std::set<std::string> Names;
    EXPECT_EQ(query(f.root, L"type(path(0,\"\"),\"script\")==1"), (Names{"bin/run.sh"}));
    EXPECT_EQ(query(f.root, L"type(path(0,\"\"),\"empty\")"), (Names{"data/empty.dat"}));
    EXPECT_EQ(query(f.root, L"type(path(0,\"\"),\"script\")==1 || [SIZE]==4"),
              (Names{"bin/run.sh", "data/sub/deep.txt"}));
    EXPECT_EQ(query(f.root, L"[FILENAME]==\"*.sh\" && type(path(0,\"\"),\"ELF\")==1"), Names{});
}

TEST(FileProcessorWalk, KnownChecksumSetSelectsTheFilesWithThoseContents) {
    TempDir dir;
    dir.write("one/abc", "abc");
    dir.write("two/copy-of-abc", "abc");
    dir.write("two/def", "def");
    dir.write("three/xyz", "xyz");
    typedef std::set<std::string> Names;

    FileHashBlackBox byCrc;
    byCrc.insert_crc32(kCrc32OfAbc);
    FileProcessor crcProcessor(L"[SIZE]>=0", true, 0x40, &byCrc);
    EXPECT_EQ(walk(crcProcessor, dir.path()), (Names{"one/abc", "two/copy-of-abc"}));

    byCrc.insert_crc32(kCrc32OfDef);
    FileProcessor both(L"[SIZE]>=0", true, 0x40, &byCrc);
    EXPECT_EQ(walk(both, dir.path()), (Names{"one/abc", "two/copy-of-abc", "two/def"}));

    FileHashBlackBox byMd5;
    byMd5.insert_md5(char2md5(kMd5OfAbc));
    FileProcessor md5Processor(L"[SIZE]>=0", true, 0x20, &byMd5);
    EXPECT_EQ(walk(md5Processor, dir.path()), (Names{"one/abc", "two/copy-of-abc"}));

    // The set narrows what the expression found, never widens it.
    FileProcessor narrowed(L"[FILENAME]==\"copy-*\"", true, 0x40, &byCrc);
    EXPECT_EQ(walk(narrowed, dir.path()), (Names{"two/copy-of-abc"}));

    // Without checksum flags no sum is marked, so the set matches nothing.
    FileProcessor unmarked(L"[SIZE]>=0", true, 0x1f, &byCrc);
    EXPECT_TRUE(walk(unmarked, dir.path()).empty());
}

TEST(FileProcessorWalk, LinkVisitedAfterAKnownFileCarriesItsSumsIntoTheSet) {
    TempDir dir;
    dir.write("abc", "abc");
    ASSERT_EQ(symlink("abc", dir.file("link").c_str()), 0);
    // The walk visits entries in reverse readdir order; a link's content is
    // never read, so it keeps the sums of the file visited before it.
    std::vector<std::string> order;
    DIR* handle = opendir(dir.path().c_str());
    ASSERT_NE(handle, nullptr);
    while (struct dirent* e = readdir(handle)) order.push_back(e->d_name);
    closedir(handle);
    size_t abcAt = 0, linkAt = 0;
    for (size_t i = 0; i < order.size(); ++i) {
        if (order[i] == "abc") abcAt = i;
        if (order[i] == "link") linkAt = i;
    }
    bool linkAfterFile = linkAt < abcAt;
    FileHashBlackBox known;
    known.insert_crc32(kCrc32OfAbc);
    FileProcessor processor(L"[SIZE]>=0", true, 0x40, &known);
    std::set<std::string> expected{"abc"};
    if (linkAfterFile) expected.insert("link");
    EXPECT_EQ(walk(processor, dir.path()), expected);
}

TEST(FileProcessorWalk, NullCriteriaWritesNothingEvenWithAMatchingKnownSet) {
    TempDir dir;
    dir.write("abc", "abc");
    dir.write("sub/abc", "abc");
    FileHashBlackBox known;
    known.insert_crc32(kCrc32OfAbc);
    FileProcessor processor(nullptr, true, 0x40, &known);
    int result = -1;
    EXPECT_TRUE(walk(processor, dir.path(), &result).empty());
    EXPECT_EQ(result, 0);
}

namespace {

// Every path under root (root included) named "pwned".
std::vector<std::string> pwnedUnder(const std::string& root) {
    std::string found = testsupport::runCommand("find '" + root + "' -name pwned 2>/dev/null");
    std::vector<std::string> out;
    size_t start = 0;
    while (start < found.size()) {
        size_t end = found.find('\n', start);
        if (end == std::string::npos) end = found.size();
        if (end > start) out.push_back(found.substr(start, end - start));
        start = end + 1;
    }
    return out;
}

// Runs the test body with a fresh temporary directory as working directory,
// where a command escaping its quotes would drop a relative file.
class WorkingDirectory {
public:
    WorkingDirectory() {
        char buffer[PATH_MAX];
        if (getcwd(buffer, sizeof buffer) != nullptr) previous = buffer;
        changed = chdir(scratch.path().c_str()) == 0;
    }
    ~WorkingDirectory() {
        if (!previous.empty() && chdir(previous.c_str()) != 0) std::abort();
    }
    TempDir scratch;
    std::string previous;
    bool changed = false;
};

// Counts the files the walk offers whose path holds a text.
std::string offeredPart;
int offeredCount = 0;
void countOffer(const FsFileInfo& info, const FileChecksumInfo&, const wchar_t*) {
    if ((narrow(info.getPath()) + narrow(info.getName())).find(offeredPart) != std::string::npos) {
        ++offeredCount;
    }
}

}  // namespace

TEST(FileProcessorWalk, TypeCheckNeverRunsAShellCommandHiddenInADirectoryName) {
    if (!fileCommandPresent()) GTEST_SKIP() << "the file command is not installed";
    TempDir fixture;
    const std::string hostile = "x\";touch pwned;\"";
    fixture.write(hostile + "/run.sh", "#!/bin/sh\necho hi\n");
    fixture.write(hostile + "/notes.txt", "hello\n");
    fixture.write(hostile + "/deeper/inner.sh", "#!/bin/sh\necho in\n");
    fixture.write("plain/ok.sh", "#!/bin/sh\necho ok\n");
    WorkingDirectory cwd;
    ASSERT_TRUE(cwd.changed);
    std::string originalCwd = cwd.previous;

    TraceCapture capture;
    FileProcessor processor(L"type(path(0,\"\"),\"script\")==1", true);
    offeredPart = hostile;
    offeredCount = 0;
    FileProcessor::setCriteriaObserver(countOffer);
    int result = -1;
    std::set<std::string> hits = walk(processor, fixture.path(), &result);
    FileProcessor::setCriteriaObserver(nullptr);
    EXPECT_EQ(result, 0);
    // All three files under the hostile name were offered to the check.
    EXPECT_EQ(offeredCount, 3);
    // The ordinary directory is classified; the hostile one is refused, so
    // its scripts are not of the type.
    EXPECT_EQ(hits, (std::set<std::string>{"plain/ok.sh"}));
    EXPECT_TRUE(capture.contains("which would break the quoted command; not run")) << capture.dump();
    // Asked directly, the check answers false for the hostile directory's script.
    std::wstring hostileDir = wide(fixture.file(hostile) + "/");
    FileChecksumInfo none;
    EXPECT_FALSE(processor.satisfyCriteria(fileRecord(hostileDir.c_str(), L"run.sh", 18, 0x2000), none,
                                           nullptr));

    EXPECT_TRUE(pwnedUnder(fixture.path()).empty());
    EXPECT_TRUE(pwnedUnder(cwd.scratch.path()).empty());
    EXPECT_FALSE(testsupport::fileExists(originalCwd + "/pwned"));
    // The hostile directory's files were there to be found.
    EXPECT_TRUE(testsupport::fileExists(fixture.file(hostile + "/run.sh")));
}

TEST(FileProcessorWalk, TypeCheckNeverRunsShellWordsHiddenInFileNames) {
    if (!fileCommandPresent()) GTEST_SKIP() << "the file command is not installed";
    TempDir fixture;
    fixture.write("dir/$(touch pwned1)", "#!/bin/sh\n");
    fixture.write("dir/;touch pwned2;", "#!/bin/sh\n");
    fixture.write("dir/`touch pwned3`", "#!/bin/sh\n");
    fixture.write("dir/ok.sh", "#!/bin/sh\necho ok\n");
    WorkingDirectory cwd;
    ASSERT_TRUE(cwd.changed);

    FileProcessor processor(L"type(path(0,\"\"),\"script\")==1", true);
    std::set<std::string> hits = walk(processor, fixture.path());
    EXPECT_EQ(hits.count("dir/ok.sh"), 1u);
    std::string leftovers = testsupport::runCommand(
        "find '" + fixture.path() + "' '" + cwd.scratch.path() + "' -name 'pwned*' 2>/dev/null");
    EXPECT_EQ(leftovers, "");
    EXPECT_FALSE(testsupport::fileExists(cwd.previous + "/pwned1"));
    EXPECT_FALSE(testsupport::fileExists(cwd.previous + "/pwned2"));
    EXPECT_FALSE(testsupport::fileExists(cwd.previous + "/pwned3"));
}
