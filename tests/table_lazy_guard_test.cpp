// The table guard checks at open only what costs the same for any size, and
// at each read, lookup and walk what that operation relies on: damage in a
// row that is read is found, damage in rows that are not read does not stand
// in the way of an answer, and a damaged chain ends every walk along it.
#include "fscanner/fscommon/table.h"

#include <gtest/gtest.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "fscanner/fscommon/sync.h"
#include "support/testsupport.h"

namespace {

std::wstring wide(const std::string& s) { return std::wstring(s.begin(), s.end()); }

const char kMisfiled[] = "record does not hold the key its index entry is filed under";
const char kBadLink[] = "chain link points outside the overflow slots";
const char kOutside[] = "slot points outside the records of the data file";
const char kStoredCount[] = "stored count differs from the live slots of the pointer file";

uint32_t word(const std::string& bytes, size_t at) {
    uint32_t v;
    std::memcpy(&v, bytes.data() + at, 4);
    return v;
}

void putWord(std::string* bytes, size_t at, uint32_t v) { std::memcpy(&(*bytes)[at], &v, 4); }

void writeFile(const std::string& path, const std::string& bytes) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
}

// Ten records in directories 100..109: the odd ones named "name1", "name3",
// ... "name9", the even ones all "same.txt", so that one FILENAME chain
// holds records 8, 6, 4, 2, 0 in that order (newest first).
class TableLazyGuardTest : public ::testing::Test {
protected:
    void SetUp() override {
        std::memcpy(savedStore, LinuxSharedMutex::storePath, sizeof savedStore);
        ASSERT_TRUE(LinuxSharedMutex::setStorePath(locks.path().c_str()));
        wdir = wide(dir.path() + "/");
        t.reset(new FS_Table(L"files", wdir.c_str(), false));
        t->addField(L"FILENAME", FIELD_TEXT);
        t->addField(L"PATHID", FIELD_INT32);
        ASSERT_TRUE(t->create());
        ASSERT_TRUE(t->addHashIndex(L"files_FILENAME", L"FILENAME"));
        ASSERT_TRUE(t->addHashIndex(L"files_PATHID", L"PATHID"));
        for (unsigned int i = 0; i < 10; ++i) {
            Fields rec(t->getFields());
            std::wstring name = i % 2 == 0 ? L"same.txt" : L"name" + std::to_wstring(i);
            static_cast<TextField*>(rec.at(0))->value(name.c_str());
            static_cast<Int32Field*>(rec.at(1))->value(100 + i);
            ASSERT_TRUE(t->insert(rec));
        }
        t->close();
    }
    void TearDown() override {
        t.reset();
        std::memcpy(LinuxSharedMutex::storePath, savedStore, sizeof savedStore);
    }
    // Reopens the table with its columns and arms the guard.
    bool reopen() {
        t.reset(new FS_Table(L"files", wdir.c_str(), false));
        return t->open() && t->verify();
    }
    std::string path(const std::string& name) { return dir.path() + "/" + name; }
    std::wstring wpath(const std::string& name) { return wide(path(name)); }
    // Where record id starts in the data file.
    uint32_t offsetOf(unsigned int id) { return word(testsupport::readFile(path("files.pxx")), id * 4); }
    // Overwrites bytes of a table file at offset.
    void patch(const std::string& name, size_t at, const std::string& bytes) {
        std::string all = testsupport::readFile(path(name));
        ASSERT_LE(at + bytes.size(), all.size());
        all.replace(at, bytes.size(), bytes);
        writeFile(path(name), all);
    }
    // The index slots of the chain of key's bucket, head first.
    std::vector<uint32_t> chainOf(const std::string& index, const wchar_t* key) {
        std::string all = testsupport::readFile(path(index));
        std::vector<uint32_t> slots;
        uint32_t slot = static_cast<uint32_t>(hash(key, Index::BUCKETS));
        while (slot != Index::EMPTY && slots.size() < 100) {
            slots.push_back(slot);
            slot = word(all, static_cast<size_t>(slot) * 8 + 4);
        }
        return slots;
    }
    bool readName(unsigned int id, std::wstring* name) {
        Fields rec(t->getFields());
        if (!t->read(id, rec)) return false;
        *name = static_cast<TextField*>(rec.at(0))->value();
        return true;
    }
    // Every live record of key's FILENAME chain, as a cursor reads them.
    bool lookUp(const wchar_t* key, std::vector<std::wstring>* names) {
        Index* index = t->searchHashIndexForFieldName(L"FILENAME", false);
        if (index == nullptr) return false;
        unsigned int id = 0, next = 0;
        for (bool row = t->hashIndex_moveFirst(*index, key, id, next); row;
             row = t->hashIndex_moveNext(*index, id, next)) {
            std::wstring name;
            if (!readName(id, &name)) return false;
            names->push_back(name);
        }
        return !t->isDamaged();
    }

    testsupport::TempDir dir;
    testsupport::TempDir locks;
    std::wstring wdir;
    char savedStore[sizeof LinuxSharedMutex::storePath];
    std::unique_ptr<FS_Table> t;
};

}  // namespace

TEST_F(TableLazyGuardTest, SoundTablePassesEveryCheckAndTheWholeCheck) {
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    EXPECT_TRUE(lookUp(L"SAME.TXT", &names));
    EXPECT_EQ(5u, names.size());
    unsigned int id = 0;
    unsigned int live = 0;
    for (bool row = t->moveFirst(id); row; row = t->moveNext(id)) {
        std::wstring name;
        EXPECT_TRUE(readName(id, &name)) << id;
        ++live;
    }
    EXPECT_EQ(10u, live);
    EXPECT_FALSE(t->isDamaged());
    EXPECT_TRUE(t->verifyWhole());
}

TEST_F(TableLazyGuardTest, SlotOutsideTheDataIsFoundByTheReadOfItsRowOnly) {
    std::string far;
    far.resize(4);
    putWord(&far, 0, 0x00FFFFF0u);
    patch("files.pxx", 7 * 4, far);
    ASSERT_TRUE(reopen());
    // Rows and lookups that do not touch slot 7 answer as before (record 6
    // would: its end is checked against the start of record 7).
    std::wstring name;
    EXPECT_TRUE(readName(3, &name));
    EXPECT_EQ(L"name3", name);
    std::vector<std::wstring> names;
    EXPECT_TRUE(lookUp(L"NAME5", &names));
    ASSERT_EQ(1u, names.size());
    EXPECT_EQ(L"name5", names[0]);
    EXPECT_FALSE(t->isDamaged());
    // The read of record 7 relies on its slot.
    EXPECT_FALSE(readName(7, &name));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kOutside, t->damagedCheck());
    EXPECT_EQ(wpath("files.pxx"), std::wstring(t->damagedFile()));
    // A damaged table reads nothing more.
    EXPECT_FALSE(readName(3, &name));
}

TEST_F(TableLazyGuardTest, TheWholeCheckFindsDamageNoReadHasTouched) {
    std::string far;
    far.resize(4);
    putWord(&far, 0, 0x00FFFFF0u);
    patch("files.pxx", 7 * 4, far);
    ASSERT_TRUE(reopen());
    EXPECT_FALSE(t->isDamaged());
    EXPECT_FALSE(t->verifyWhole());
    EXPECT_STREQ(kOutside, t->damagedCheck());
}

TEST_F(TableLazyGuardTest, KeyChangedInPlaceIsFoundByAReadByNumber) {
    // "name3" becomes "nbme3": the record decodes, its key hashes elsewhere.
    patch("files.dat", offsetOf(3) + 1 + 2 + 1, "b");
    ASSERT_TRUE(reopen());
    std::wstring name;
    EXPECT_FALSE(readName(3, &name));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kMisfiled, t->damagedCheck());
    EXPECT_EQ(wpath("files_FILENAME.idx"), std::wstring(t->damagedFile()));
}

TEST_F(TableLazyGuardTest, KeyChangedInPlaceIsFoundByTheLookupThatMeetsIt) {
    patch("files.dat", offsetOf(3) + 1 + 2 + 1, "b");
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    EXPECT_FALSE(lookUp(L"NAME3", &names));
    EXPECT_TRUE(names.empty());
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kMisfiled, t->damagedCheck());
}

TEST_F(TableLazyGuardTest, DamagedRowOutsideTheLookupDoesNotStandInTheWayOfItsAnswer) {
    patch("files.dat", offsetOf(3) + 1 + 2 + 1, "b");
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    EXPECT_TRUE(lookUp(L"NAME5", &names));
    ASSERT_EQ(1u, names.size());
    EXPECT_EQ(L"name5", names[0]);
    EXPECT_TRUE(lookUp(L"SAME.TXT", &names));
    EXPECT_EQ(6u, names.size());
    EXPECT_FALSE(t->isDamaged());
}

TEST_F(TableLazyGuardTest, ChainLinkThatClimbsEndsTheLookupAsDamage) {
    std::vector<uint32_t> chain = chainOf("files_FILENAME.idx", L"SAME.TXT");
    ASSERT_EQ(5u, chain.size());  // the bucket and four overflow slots
    // The third slot links back up to the second: a ring.
    std::string link(4, '\0');
    putWord(&link, 0, chain[1]);
    patch("files_FILENAME.idx", static_cast<size_t>(chain[2]) * 8 + 4, link);
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(lookUp(L"SAME.TXT", &names));
    auto elapsed = std::chrono::steady_clock::now() - start;
    EXPECT_LT(std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count(), 1000);
    EXPECT_LE(names.size(), 3u);
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kBadLink, t->damagedCheck());
    EXPECT_EQ(wpath("files_FILENAME.idx"), std::wstring(t->damagedFile()));
}

TEST_F(TableLazyGuardTest, ChainLinkPastTheIndexFileEndsTheLookupAsDamage) {
    std::vector<uint32_t> chain = chainOf("files_FILENAME.idx", L"SAME.TXT");
    ASSERT_EQ(5u, chain.size());
    std::string link(4, '\0');
    putWord(&link, 0, 0x7FFFFFF0u);
    patch("files_FILENAME.idx", static_cast<size_t>(chain[0]) * 8 + 4, link);
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    EXPECT_FALSE(lookUp(L"SAME.TXT", &names));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kBadLink, t->damagedCheck());
}

TEST_F(TableLazyGuardTest, ReadByNumberOverARingInItsKeysChainEnds) {
    std::vector<uint32_t> chain = chainOf("files_FILENAME.idx", L"SAME.TXT");
    ASSERT_EQ(5u, chain.size());
    // Record 0, the oldest "same.txt", sits at the end of the chain: its
    // search has to pass the ring.
    std::string link(4, '\0');
    putWord(&link, 0, chain[1]);
    patch("files_FILENAME.idx", static_cast<size_t>(chain[3]) * 8 + 4, link);
    ASSERT_TRUE(reopen());
    std::wstring name;
    auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(readName(0, &name));
    auto elapsed = std::chrono::steady_clock::now() - start;
    EXPECT_LT(std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count(), 1000);
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kBadLink, t->damagedCheck());
}

TEST_F(TableLazyGuardTest, EntryNamingARecordPastThePointerFileIsDamage) {
    std::vector<uint32_t> chain = chainOf("files_FILENAME.idx", L"NAME5");
    ASSERT_EQ(1u, chain.size());
    std::string id(4, '\0');
    putWord(&id, 0, 5000);
    patch("files_FILENAME.idx", static_cast<size_t>(chain[0]) * 8, id);
    ASSERT_TRUE(reopen());
    std::vector<std::wstring> names;
    EXPECT_FALSE(lookUp(L"NAME5", &names));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ("index entry names a record past the pointer file", t->damagedCheck());
}

TEST_F(TableLazyGuardTest, WalkToTheEndFindsALiveSlotZeroed) {
    // Record 4 looks removed, but the counts still say ten live and none
    // removed: only the number of live slots, which a walk counts, tells.
    patch("files.pxx", 4 * 4, std::string(4, '\0'));
    ASSERT_TRUE(reopen());
    unsigned int id = 0;
    unsigned int seen = 0;
    // A walk that stops early has not counted every slot.
    for (bool row = t->moveFirst(id); row && seen < 6; row = t->moveNext(id)) ++seen;
    EXPECT_FALSE(t->isDamaged());
    seen = 0;
    for (bool row = t->moveFirst(id); row; row = t->moveNext(id)) ++seen;
    EXPECT_EQ(9u, seen);
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ(kStoredCount, t->damagedCheck());
    EXPECT_EQ(wpath("files.dat"), std::wstring(t->damagedFile()));
}

TEST_F(TableLazyGuardTest, WalkWithARemovalOnTheWayDoesNotCountAsDamage) {
    ASSERT_TRUE(reopen());
    unsigned int id = 0;
    unsigned int seen = 0;
    for (bool row = t->moveFirst(id); row; row = t->moveNext(id)) {
        if (id == 5) {
            ASSERT_TRUE(t->remove(2));
        }
        ++seen;
    }
    EXPECT_EQ(10u, seen);
    EXPECT_FALSE(t->isDamaged());
}

TEST_F(TableLazyGuardTest, CountsAgainstTheSlotCountAreCheckedAtOpen) {
    std::string count(4, '\0');
    putWord(&count, 0, 11);  // stored: more than the ten slots
    patch("files.dat", 0, count);
    t.reset(new FS_Table(L"files", wdir.c_str(), false));
    ASSERT_TRUE(t->open());
    EXPECT_FALSE(t->verify());
    EXPECT_STREQ(kStoredCount, t->damagedCheck());
}

namespace {

char const* refuseDirectory103(void* context, Fields& record) {
    ++*static_cast<int*>(context);
    Field* path = record.name(L"PATHID");
    return path != nullptr && static_cast<Int32Field*>(path)->value() == 103 ? "row refused" : nullptr;
}

}  // namespace

TEST_F(TableLazyGuardTest, RowCheckRefusalIsTheDamageOfTheDataFile) {
    ASSERT_TRUE(reopen());
    int calls = 0;
    t->setRowCheck(refuseDirectory103, &calls);
    std::wstring name;
    EXPECT_TRUE(readName(2, &name));
    EXPECT_FALSE(t->isDamaged());
    EXPECT_FALSE(readName(3, &name));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ("row refused", t->damagedCheck());
    EXPECT_EQ(wpath("files.dat"), std::wstring(t->damagedFile()));
    EXPECT_GE(calls, 2);
}

TEST_F(TableLazyGuardTest, AWalkChecksEachIndexWholeAtItsFirstRow) {
    // The chain of "same.txt" cut behind its bucket: records 6, 4, 2 and 0
    // are in no chain any more.  Record 1 ("name1") is filed soundly.
    std::vector<uint32_t> chain = chainOf("files_FILENAME.idx", L"SAME.TXT");
    ASSERT_EQ(5u, chain.size());
    std::string end(4, '\0');
    putWord(&end, 0, Index::EMPTY);
    patch("files_FILENAME.idx", static_cast<size_t>(chain[0]) * 8 + 4, end);

    // Read by number, record 1 finds its own chain whole.
    ASSERT_TRUE(reopen());
    std::wstring name;
    EXPECT_TRUE(readName(1, &name));
    EXPECT_FALSE(t->isDamaged());

    // Read in a walk over every row, it brings the whole index in.
    ASSERT_TRUE(reopen());
    unsigned int id = 0;
    ASSERT_TRUE(t->moveFirst(id));
    ASSERT_TRUE(t->moveNext(id));
    ASSERT_EQ(1u, id);
    EXPECT_FALSE(readName(1, &name));
    ASSERT_TRUE(t->isDamaged());
    EXPECT_STREQ("overflow slot outside every chain", t->damagedCheck());
    EXPECT_EQ(wpath("files_FILENAME.idx"), std::wstring(t->damagedFile()));
}

// The whole check of an index has two forms that must agree on every index:
// the walk along the chains that names the damage, and the pass in file
// order that only says whether there is any.  Indexes built as inserts
// build them, with one word changed or not, are given to both.
TEST(IndexWholeCheck, PassInFileOrderAgreesWithTheChainWalk) {
    const uint32_t kEmpty = Index::EMPTY;  // a copy: vectors bind it by reference
    uint32_t seed = 20261125;
    auto random = [&seed](uint32_t below) {
        seed = seed * 1103515245u + 12345u;
        return below == 0 ? 0 : (seed >> 8) % below;
    };
    int sound = 0, damaged = 0;
    for (int trial = 0; trial < 600; ++trial) {
        uint32_t records = 1 + random(300);
        std::vector<uint32_t> words(static_cast<size_t>(Index::BUCKETS) * 2, kEmpty);
        // Few buckets, so that chains grow long; bucket 65535 as well, the
        // last bucket slot.
        uint32_t spread = 1 + random(6);
        for (uint32_t id = 0; id < records; ++id) {
            uint32_t bucket = random(8) == 0 ? Index::BUCKETS - 1 : random(spread);
            size_t head = static_cast<size_t>(bucket) * 2;
            if (words[head] != kEmpty) {
                uint32_t slot = static_cast<uint32_t>(words.size() / 2);
                words.push_back(words[head]);
                words.push_back(words[head + 1]);
                words[head + 1] = slot;
            }
            words[head] = id;
        }
        uint32_t total = static_cast<uint32_t>(words.size() / 2);
        uint32_t checkedRecords = records;
        switch (random(6)) {
            case 0:
                break;  // sound
            case 1: {   // a word of a used slot changed
                std::vector<uint32_t> used;
                for (uint32_t s = 0; s < total; ++s)
                    if (words[static_cast<size_t>(s) * 2] != kEmpty) used.push_back(s);
                size_t at = static_cast<size_t>(used[random(static_cast<uint32_t>(used.size()))]) * 2 + random(2);
                uint32_t values[] = {kEmpty, random(records + 2), random(total + 2), Index::BUCKETS + random(8),
                                     random(Index::BUCKETS), 0};
                words[at] = values[random(6)];
                break;
            }
            case 2:  // an empty bucket given a chain
                words[static_cast<size_t>(Index::BUCKETS - 2) * 2 + 1] = Index::BUCKETS + random(total - Index::BUCKETS + 1);
                break;
            case 3:  // an overflow slot that no chain reaches
                words.push_back(random(records));
                words.push_back(kEmpty);
                ++total;
                break;
            case 4:  // one record more or less than the index holds
                checkedRecords = random(2) == 0 ? records + 1 : records - 1;
                break;
            default: {  // two words swapped
                size_t a = random(total) * 2u + random(2), b = random(total) * 2u + random(2);
                std::swap(words[a], words[b]);
                break;
            }
        }
        auto slotBytes = [&words](uint32_t first, uint32_t count) -> const char* {
            if (static_cast<size_t>(first + count) * 2 > words.size()) return nullptr;
            return reinterpret_cast<const char*>(words.data() + static_cast<size_t>(first) * 2);
        };
        BucketMap byPass, byChains;
        bool passSound = indexChainsSound(slotBytes, total, checkedRecords, byPass);
        char const* damage = indexChainsDamage(words, total, checkedRecords, byChains);
        ASSERT_EQ(damage == nullptr, passSound) << "trial " << trial << ": " << (damage ? damage : "sound");
        if (passSound) {
            EXPECT_EQ(byChains, byPass) << "trial " << trial;
            ++sound;
        } else {
            ++damaged;
        }
    }
    // Both answers were given often.
    EXPECT_GT(sound, 100);
    EXPECT_GT(damaged, 200);
}
