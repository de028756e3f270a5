// Corruption drill: a cache of a small tree is damaged one file at a time, at
// many offsets and in many ways (zeroes, 0xff, random bytes from a fixed
// seed, truncation, extension), and queried in a forked child under alarm().
//
// Every case must end without a crash or a hang.  Damage to the structure
// of a file (lengths, counts, offsets, slots, index chains, parent ids, file
// sizes, the marks) must give exactly the right answer or the cache-unusable
// result: -40 from the query, or the open refused.  A changed byte inside a
// stored name or number is payload: without a checksum it can only be seen
// where the store holds the value twice (an indexed column is also filed
// under its key's hash), so those cases are counted apart and may answer
// wrong.  The offsets are told apart with the layout of table_format.h.
#include <gtest/gtest.h>
#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "fscanner/fs/fs_query.h"
#include "fscanner/fscommon/cache2.h"
#include "fscanner/fscommon/cachebase.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/table.h"
#include "fscanner/fscommon/table_format.h"
#include "support/cachefixture.h"

using testsupport::widen;

namespace {

const unsigned int LONG_AGE = 3600 * 24;
const wchar_t EXACT_QUERY[] = L"[FILENAME]==\"notes.txt\"";
const wchar_t FULL_QUERY[] = L"[SIZE]>=0";

// How a case ended, as the child's exit code.
enum Verdict { RIGHT = 0, REFUSED = 10, CAUGHT = 11, WRONG = 12, OTHER = 13, CRASH = 100, HANG = 101 };

enum Kind { ZEROES, FF, RANDOM, TRUNCATE, EXTEND, KINDS };
char const* const kindNames[KINDS] = {"zeroes", "0xff", "random", "truncate", "extend"};

// Collects every record whole, in a sorted list, so that a lost or a
// doubled hit and any changed value show.
class RecordWriter : public FsResultSetWriter {
public:
    int addRecord(const wchar_t* path, const wchar_t* name, unsigned long long size, unsigned int attr,
                  const wchar_t* md5, unsigned int crc, unsigned int q32) override {
        records.push_back(testsupport::joinPath(testsupport::bytesOf(path), testsupport::bytesOf(name)) +
                          "|" + std::to_string(size) + "|" + std::to_string(attr) + "|" +
                          testsupport::bytesOf(md5) + "|" + std::to_string(crc) + "|" +
                          std::to_string(q32));
        return 0;
    }
    int addRecord(const FsFileInfo& info) override {
        return addRecord(info.getPath(), info.getName(), info.getSize(), info.getAttr(),
                         info.getMD5(), info.getCRC32(), info.getQ32());
    }
    int close() override { return 0; }
    std::vector<std::string> sorted() {
        std::sort(records.begin(), records.end());
        return records;
    }
    std::vector<std::string> records;
};

struct Answers {
    std::vector<std::string> exact;
    std::vector<std::string> full;
};

int runQuery(FS_Cache& cache, const std::string& root, const wchar_t* text, std::vector<std::string>* out)
{
    FsQuery q;
    q.setQuery(text);
    q.addIncludePath(widen(root).c_str(), true);
    RecordWriter writer;
    int rc = cache.executeQueryEx(writer, q, 600000, LONG_AGE);
    *out = writer.sorted();
    return rc;
}

std::map<std::string, std::string> snapshot(const std::string& dir)
{
    std::map<std::string, std::string> files;
    DIR* d = opendir(dir.c_str());
    if (d == nullptr)
        return files;
    while (dirent* e = readdir(d)) {
        std::string name = e->d_name;
        if (name != "." && name != "..")
            files[name] = testsupport::readFile(dir + "/" + name);
    }
    closedir(d);
    return files;
}

bool writeWhole(const std::string& path, const std::string& bytes)
{
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0600);
    if (fd < 0)
        return false;
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = write(fd, bytes.data() + done, bytes.size() - done);
        if (n <= 0)
            break;
        done += static_cast<size_t>(n);
    }
    close(fd);
    return done == bytes.size();
}

// Puts the directory back as the snapshot has it: files the query added go,
// changed or removed ones are written again.
void restore(const std::string& dir, std::map<std::string, std::string> const& pristine)
{
    std::map<std::string, std::string> now = snapshot(dir);
    for (auto const& f : now)
        if (pristine.find(f.first) == pristine.end())
            unlink((dir + "/" + f.first).c_str());
    for (auto const& f : pristine) {
        auto it = now.find(f.first);
        if (it == now.end() || it->second != f.second)
            writeWhole(dir + "/" + f.first, f.second);
    }
}

bool endsWith(const std::string& s, const std::string& tail)
{
    return s.size() >= tail.size() && s.compare(s.size() - tail.size(), tail.size(), tail) == 0;
}

// What each byte of a cache file is.  Payload: the text bytes of stored
// values and the integer columns that are plain numbers, not ids.  Presence
// bits: read and dropped again (every value read clears its null flag), so
// no reader sees them.  Everything else, and everything outside the data
// files, is structure.
const char STRUCTURE = 'S';
const char PAYLOAD = 'P';
const char PRESENCE = 'B';

std::string byteClasses(const std::string& name, std::map<std::string, std::string> const& files)
{
    using namespace tableformat;
    std::string const& bytes = files.at(name);
    std::string structure(bytes.size(), STRUCTURE);
    if (!endsWith(name, ".dat") || endsWith(name, "_idx.dat"))
        return structure;
    std::string pointerName = name.substr(0, name.size() - 4) + ".pxx";
    if (files.find(pointerName) == files.end() || bytes.size() < kFixedHeaderSize)
        return structure;
    std::string const& pointers = files.at(pointerName);
    uint32_t fieldCount = codec::decodeFixed32(bytes.data() + kFieldCountOffset);
    size_t pos = kFixedHeaderSize;
    std::vector<std::pair<uint32_t, std::string>> columns;
    for (uint32_t i = 0; i < fieldCount && pos + kDescriptorFixedSize <= bytes.size(); ++i) {
        uint32_t type = codec::decodeFixed32(bytes.data() + pos);
        uint32_t length = codec::decodeFixed32(bytes.data() + pos + kDescriptorTypeSize);
        pos += kDescriptorFixedSize;
        std::string column;
        for (uint32_t c = 0; c + kWideCharSize <= length && pos + c + kWideCharSize <= bytes.size(); c += kWideCharSize)
            column += static_cast<char>(codec::decodeFixed32(bytes.data() + pos + c));
        pos += length;
        columns.emplace_back(type, column);
    }
    for (size_t slot = 0; slot + kSlotSize <= pointers.size(); slot += kSlotSize) {
        size_t at = codec::decodeFixed32(pointers.data() + slot);
        if (at == kRemovedSlot)
            continue;
        for (size_t b = at; b < at + bitmapBytes(fieldCount) && b < bytes.size(); ++b)
            structure[b] = PRESENCE;
        at += bitmapBytes(fieldCount);
        for (auto const& column : columns) {
            size_t width = 0;
            bool isId = column.second == "ID" || column.second == "PARENTID" || column.second == "PATHID";
            switch (column.first) {
            case 1: width = 1; break;
            case 2: width = 2; break;
            case 3: width = 4; break;
            case 4: width = 8; break;
            case 5: {
                if (at + kPlainTextLengthSize > bytes.size())
                    return structure;
                width = codec::decodeFixed16(bytes.data() + at);
                at += kPlainTextLengthSize;  // the length itself is structure
                isId = false;
                break;
            }
            default: break;
            }
            for (size_t b = at; b < at + width && b < bytes.size(); ++b)
                structure[b] = isId ? STRUCTURE : PAYLOAD;
            at += width;
        }
    }
    return structure;
}

struct Case {
    std::string file;
    Kind kind;
    size_t offset = 0;          // overwrite kinds
    std::string bytes;          // overwrite and extend kinds
    size_t newSize = 0;         // truncate
    // Changes a byte of structure, or changes presence bits only.  A case
    // that changes payload and no structure is not.
    bool structural = true;
    std::string classes;        // of the changed bytes
};

std::string damaged(Case const& c, std::string const& original)
{
    std::string out = original;
    switch (c.kind) {
    case TRUNCATE: out.resize(c.newSize); break;
    case EXTEND: out += c.bytes; break;
    default: out.replace(c.offset, c.bytes.size(), c.bytes); break;
    }
    return out;
}

// Offsets worth damaging: in an index file the slots that hold an entry
// (most buckets are empty and read 0xff), elsewhere every byte.
std::vector<size_t> candidateOffsets(const std::string& name, const std::string& bytes, std::mt19937& rng)
{
    std::vector<size_t> offsets;
    if (endsWith(name, ".idx")) {
        for (size_t slot = 0; slot + 8 <= bytes.size(); slot += 8)
            if (bytes.compare(slot, 8, std::string(8, '\xff')) != 0) {
                offsets.push_back(slot);
                offsets.push_back(slot + 4);
            }
        for (int i = 0; i < 8 && !bytes.empty(); ++i)
            offsets.push_back(rng() % bytes.size());
    } else {
        for (size_t i = 0; i < bytes.size(); ++i)
            offsets.push_back(i);
    }
    return offsets;
}

std::vector<Case> makeCases(std::map<std::string, std::string> const& files, unsigned int perKind)
{
    std::mt19937 rng(20240607u);
    std::vector<Case> cases;
    for (auto const& f : files) {
        std::string const& bytes = f.second;
        std::string structure = byteClasses(f.first, files);
        std::vector<size_t> offsets = candidateOffsets(f.first, bytes, rng);
        for (int kind = ZEROES; kind <= RANDOM; ++kind) {
            std::vector<size_t> pool = offsets;
            std::shuffle(pool.begin(), pool.end(), rng);
            unsigned int made = 0;
            for (size_t i = 0; i < pool.size() && made < perKind; ++i) {
                Case c;
                c.file = f.first;
                c.kind = static_cast<Kind>(kind);
                c.offset = pool[i];
                size_t length = kind == ZEROES ? (made % 5 == 4 ? 64 : 4) : kind == FF ? 4 : 1 + rng() % 8;
                length = std::min(length, bytes.size() - c.offset);
                for (size_t b = 0; b < length; ++b)
                    c.bytes += kind == ZEROES ? '\0' : kind == FF ? '\xff' : static_cast<char>(rng() & 0xff);
                if (damaged(c, bytes) == bytes)
                    continue;  // no damage at all
                bool anyStructure = false;
                bool anyPayload = false;
                for (size_t b = c.offset; b < c.offset + length; ++b) {
                    if (c.bytes[b - c.offset] == bytes[b])
                        continue;
                    c.classes += structure[b];
                    anyStructure = anyStructure || structure[b] == STRUCTURE;
                    anyPayload = anyPayload || structure[b] == PAYLOAD;
                }
                c.structural = anyStructure || !anyPayload;
                cases.push_back(c);
                ++made;
            }
        }
        std::vector<size_t> sizes = {0, bytes.size() / 2};
        if (bytes.size() > 0)
            sizes.push_back(bytes.size() - 1);
        if (endsWith(f.first, ".idx")) {
            sizes.push_back(524288);
            sizes.push_back(524287);
        }
        for (unsigned int i = 0; i < perKind / 10 && bytes.size() > 1; ++i)
            sizes.push_back(rng() % bytes.size());
        std::sort(sizes.begin(), sizes.end());
        sizes.erase(std::unique(sizes.begin(), sizes.end()), sizes.end());
        for (size_t size : sizes) {
            if (size >= bytes.size())
                continue;
            Case c;
            c.file = f.first;
            c.kind = TRUNCATE;
            c.newSize = size;
            cases.push_back(c);
        }
        for (size_t length : {size_t(1), size_t(4), size_t(8), size_t(256)}) {
            Case c;
            c.file = f.first;
            c.kind = EXTEND;
            for (size_t b = 0; b < length; ++b)
                c.bytes += length <= 4 ? '\0' : static_cast<char>(rng() & 0xff);
            cases.push_back(c);
        }
    }
    return cases;
}

// Opens the damaged cache, asks for the whole tree (every row is read) and
// then for one name (through the name index), and tells how it went.
int runCase(const std::string& cacheDir, const std::string& root, Answers const& answers,
            unsigned int alarmSeconds)
{
    fflush(nullptr);
    pid_t pid = fork();
    if (pid == 0) {
        alarm(alarmSeconds);
        FsGlue glue = testsupport::plainGlue();
        FS_Cache cache(L"directories", L"files", widen(cacheDir).c_str(), false, true, &glue, L"prov");
        if (cache.create(0, FS_CACHE_OPEN) != 0)
            _exit(REFUSED);
        std::vector<std::string> got;
        int rc = runQuery(cache, root, FULL_QUERY, &got);
        if (rc == CACHE_UNUSABLE)
            _exit(CAUGHT);
        if (rc != 0)
            _exit(OTHER);
        if (got != answers.full)
            _exit(WRONG);
        rc = runQuery(cache, root, EXACT_QUERY, &got);
        if (rc == CACHE_UNUSABLE)
            _exit(CAUGHT);
        if (rc != 0)
            _exit(OTHER);
        _exit(got == answers.exact ? RIGHT : WRONG);
    }
    int status = 0;
    waitpid(pid, &status, 0);
    if (WIFSIGNALED(status))
        return WTERMSIG(status) == SIGALRM ? HANG : CRASH;
    return WEXITSTATUS(status);
}

bool sanitized()
{
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    return true;
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer)
    return true;
#else
    return false;
#endif
#else
    return false;
#endif
}

bool emulated()
{
    char const* emulator = getenv("FSCANNER_TEST_EMULATOR");
    return emulator != nullptr && emulator[0] != '\0';
}

struct Tally {
    int caught = 0;
    int right = 0;
    int wrong = 0;
};

}  // namespace

TEST(CorruptionDrill, DamagedCacheFilesNeverCrashHangOrAnswerWrongForStructure)
{
    testsupport::MachineFixture machine;
    testsupport::TempDir tree;
    testsupport::TempDir cacheDir;
    std::string root = tree.path();
    while (root.size() > 1 && root.back() == '/')
        root.pop_back();
    // A few dozen files in a few directories, sizes all different.
    char const* const dirs[] = {"docs", "docs/old", "src", "src/lib", "media"};
    int n = 0;
    for (char const* dir : dirs)
        for (char const* name : {"notes.txt", "a.c", "b.h", "readme", "data.bin", "x", "long_file_name_here.dat"}) {
            if ((n % 5 == 3) && std::string(name) == "notes.txt") {
                ++n;
                continue;  // not in every directory
            }
            tree.write(std::string(dir) + "/" + name, std::string(static_cast<size_t>(n * 7 + 1), 'q'));
            ++n;
        }

    Answers answers;
    {
        FsGlue glue = testsupport::plainGlue();
        FS_Cache cache(L"directories", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN_ALWAYS));
        std::vector<std::string> built;
        ASSERT_EQ(0, runQuery(cache, root, FULL_QUERY, &built));
        cache.close();
        ASSERT_EQ(testsupport::findFiles(root).size(), built.size());
    }
    {
        FsGlue glue = testsupport::plainGlue();
        FS_Cache cache(L"directories", L"files", widen(cacheDir.path()).c_str(), false, true, &glue, L"prov");
        ASSERT_EQ(0, cache.create(0, FS_CACHE_OPEN));
        ASSERT_EQ(0, runQuery(cache, root, EXACT_QUERY, &answers.exact));
        ASSERT_EQ(0, runQuery(cache, root, FULL_QUERY, &answers.full));
        cache.close();
    }
    ASSERT_EQ(4u, answers.exact.size());
    ASSERT_EQ(testsupport::findFiles(root).size(), answers.full.size());
    std::map<std::string, std::string> pristine = snapshot(cacheDir.path());
    ASSERT_TRUE(pristine.count("files.dat") && pristine.count("directories_PATHNAME.idx") &&
                pristine.count("directories.counter") && pristine.count("ex_hash"));

    // The undamaged cache answers right through the drill's own child.
    ASSERT_EQ(RIGHT, runCase(cacheDir.path(), root, answers, 60));
    restore(cacheDir.path(), pristine);

    unsigned int perKind = 40;
    unsigned int alarmSeconds = 20;
    if (sanitized()) {
        perKind = 8;
        alarmSeconds = 120;
    }
    if (emulated()) {
        perKind = 5;
        alarmSeconds = 180;
    }
    std::vector<Case> cases = makeCases(pristine, perKind);

    // [file][kind][structural]
    std::map<std::string, std::map<int, Tally[2]>> tallies;
    int failures = 0;
    for (Case const& c : cases) {
        std::string path = cacheDir.path() + "/" + c.file;
        ASSERT_TRUE(writeWhole(path, damaged(c, pristine.at(c.file))));
        int verdict = runCase(cacheDir.path(), root, answers, alarmSeconds);
        restore(cacheDir.path(), pristine);
        Tally& t = tallies[c.file][c.kind][c.structural ? 1 : 0];
        std::string what = c.file + " " + kindNames[c.kind] +
                           (c.kind == TRUNCATE ? " to " + std::to_string(c.newSize)
                                               : " at " + std::to_string(c.offset) + " (" +
                                                     std::to_string(c.bytes.size()) + " bytes, changed " +
                                                     c.classes + ")");
        switch (verdict) {
        case RIGHT: ++t.right; break;
        case REFUSED:
        case CAUGHT: ++t.caught; break;
        case WRONG:
            ++t.wrong;
            if (c.structural && ++failures <= 25)
                ADD_FAILURE() << "wrong answer to damage of structure: " << what;
            break;
        case CRASH:
            if (++failures <= 25)
                ADD_FAILURE() << "crash: " << what;
            break;
        case HANG:
            if (++failures <= 25)
                ADD_FAILURE() << "hang: " << what;
            break;
        default:
            if (++failures <= 25)
                ADD_FAILURE() << "unexpected result " << verdict << ": " << what;
            break;
        }
    }

    // The summary: per file and kind of damage, structure and payload apart.
    printf("\n%-28s %-9s | %-23s | %-23s\n", "", "", "structure", "payload");
    printf("%-28s %-9s | %7s %7s %7s | %7s %7s %7s\n", "file", "damage", "caught", "right", "wrong",
           "caught", "right", "wrong");
    Tally total[2];
    for (auto const& file : tallies)
        for (auto const& kind : file.second) {
            Tally const* t = kind.second;
            printf("%-28s %-9s | %7d %7d %7d | %7d %7d %7d\n", file.first.c_str(), kindNames[kind.first],
                   t[1].caught, t[1].right, t[1].wrong, t[0].caught, t[0].right, t[0].wrong);
            for (int s = 0; s < 2; ++s) {
                total[s].caught += t[s].caught;
                total[s].right += t[s].right;
                total[s].wrong += t[s].wrong;
            }
        }
    printf("%-28s %-9s | %7d %7d %7d | %7d %7d %7d\n", "all files", "all", total[1].caught,
           total[1].right, total[1].wrong, total[0].caught, total[0].right, total[0].wrong);
    printf("%zu damaged caches; crashes, hangs and wrong answers to structure: %d\n", cases.size(),
           failures);
    EXPECT_EQ(0, failures);
    EXPECT_EQ(0, total[1].wrong);
}
