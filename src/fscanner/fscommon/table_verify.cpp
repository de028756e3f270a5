// The integrity guard of a table.  The formats (table_format.h) carry no
// checksum, but the three kinds of file describe one another, and a sound
// table keeps these promises, all of them cheap to test:
//
//  - records are only appended, so live slots point at rising offsets, and
//    a record ends exactly where the record of the next slot starts;
//  - every insert adds one slot and counts it as stored, every removal zeroes
//    a slot and moves one from stored to deleted, and compaction writes a
//    dense table: stored + deleted is the slot count, stored the live slots;
//  - every insert files the record number once in every index, at the head
//    of the chain of its key's bucket, and appends overflow slots only: every
//    number below the slot count is in each index exactly once, and along a
//    chain the overflow slot numbers fall;
//  - the key of a record hashes to the bucket its entries are filed under.
//
// What is checked when: verify() tests at open only what costs the same for
// any size (whole slots, the counts against the slot count, the first slot,
// every index at least its buckets).  Each read then tests what it relies
// on: its slot (inside the records), its end against the next slot, the
// links of every chain a lookup follows, and for every index that its key's
// chain holds the record (met under that bucket by the lookup, or found by
// walking the chain).  A walk over the whole pointer file tests the rising
// offsets and the stored count on its way, and checks each index whole
// (verifyIndex) at its first key check, then answers from the index's map;
// outside a walk, chain searches that add up to a share of an index's size
// do the same.  So a query that reads every row pays for each index once.
// verifyWhole() does all of it at once.
//
// A crash breaks some of these (padding, a count behind its slot): a table
// left by a crash is never verified, since the cache refuses it by its
// update flag before.
#include <cerrno>
#include <cstring>
#include <cwchar>
#include <memory>
#include <vector>

#include "base/kelmem.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/table.h"
#include "fscanner/fscommon/table_format.h"
#include "fscanner/fscommon/table_verify.h"

using namespace tableformat;

namespace {

// Logical size of an open file; its position is kept.
uint32_t contentSize(AbstractFile* file) {
    long here = file->tell();
    file->seek(0, SEEK_FROM_END);
    long end = file->tell();
    file->seek(here, SEEK_FROM_START);
    return static_cast<uint32_t>(end);
}

// The bucket an index files field's value under, as hashIndexesUpdate
// computes it; -1 for a null field or a type that is not hashed.
int keyBucket(Field* field) {
    if (field == nullptr || field->isNull()) return -1;
    wchar_t number[24];
    switch (field->getType()) {
        case FIELD_INT8:
            wcs_itoa(static_cast<Int8Field*>(field)->value(), number);
            return hash(number, Index::BUCKETS);
        case FIELD_INT16:
            wcs_itoa(static_cast<Int16Field*>(field)->value(), number);
            return hash(number, Index::BUCKETS);
        case FIELD_INT32:
            wcs_itoa(static_cast<Int32Field*>(field)->value(), number);
            return hash(number, Index::BUCKETS);
        case FIELD_INT64:
            // Keyed by the low 32 bits, as the index writes it.
            wcs_itoa(static_cast<unsigned int>(static_cast<Int64Field*>(field)->value()), number);
            return hash(number, Index::BUCKETS);
        case FIELD_TEXT: {
            wchar_t const* text = static_cast<TextField*>(field)->value();
            size_t n = text != nullptr ? wcslen(text) : 0;
            wchar_t local[256];
            wchar_t* upper = local;
            if (n > 255) {
                upper = static_cast<wchar_t*>(kelm_malloc((n + 1) * sizeof(wchar_t)));
                if (upper == nullptr) return -1;
            }
            if (n != 0) std::memcpy(upper, text, n * sizeof(wchar_t));
            upper[n] = 0;
            wcsupper(upper);
            int bucket = hash(upper, Index::BUCKETS);
            if (upper != local) kelm_free(upper);
            return bucket;
        }
        default:
            return -1;
    }
}

}  // namespace

// ---- BucketMap ---------------------------------------------------------------

void BucketMap::assignUnknown(uint32_t records) {
    buckets.assign(records, 0);
    filed.assign(records);
    unfiled = records;
}

void BucketMap::grow(uint32_t records) {
    if (records <= buckets.size()) return;
    unfiled += records - static_cast<uint32_t>(buckets.size());
    buckets.resize(records, 0);
    filed.grow(records);
}

// ---- Index -------------------------------------------------------------------

bool Index::slotCount(unsigned int* count) {
    if (file == nullptr) return false;
    uint32_t bytes = contentSize(file);
    if (bytes % 8 != 0) return false;
    *count = bytes / 8;
    return true;
}

const char* Index::slotBytes(unsigned int first, unsigned int count, std::vector<char>& spare) {
    if (file == nullptr) return nullptr;
    uint64_t from = static_cast<uint64_t>(first) * 8, bytes = static_cast<uint64_t>(count) * 8;
    if (from + bytes > 0x7FFFFFFFull) return nullptr;
    if (const char* slots = mappedBytes(file, from, static_cast<uint32_t>(bytes))) return slots;
    spare.resize(static_cast<size_t>(bytes));
    if (!file->seek(static_cast<long>(from), SEEK_FROM_START)) return nullptr;
    if (file->read(spare.data(), static_cast<unsigned int>(bytes)) != bytes) return nullptr;
    return spare.data();
}

bool Index::readSlots(unsigned int first, unsigned int count, uint32_t* words) {
    if (file == nullptr) return false;
    if (!file->seek(static_cast<long>(static_cast<unsigned long long>(first) * 8), SEEK_FROM_START)) return false;
    // Block by block, as a pass reads the file.
    const unsigned int block = 8192;  // slots per read
    std::vector<char> spare;
    for (unsigned int done = 0; done < count;) {
        unsigned int n = count - done < block ? count - done : block;
        const char* slots = slotBytes(first + done, n, spare);
        if (slots == nullptr) return false;
        uint32_t* at = words + static_cast<size_t>(done) * 2;
        for (unsigned int i = 0; i < n * 2; ++i) at[i] = codec::decodeFixed32(slots + static_cast<size_t>(i) * 4);
        done += n;
    }
    return true;
}

// ---- FS_Table ----------------------------------------------------------------

namespace {

// Chain slots a lookup may walk in one index, summed over the reads, before
// the index is checked whole: an eighth of the index, so that a query that
// reads every row pays at most that much on top of the one whole check.
uint64_t searchBudget(unsigned int indexSlots) { return indexSlots / 8u + 4096u; }

}  // namespace

void FS_Table::dropGuard() {
    delete guard;
    guard = nullptr;
}

bool FS_Table::isDamaged() const { return guard != nullptr && guard->damaged; }

wchar_t const* FS_Table::damagedFile() const { return isDamaged() ? guard->file.c_str() : nullptr; }

char const* FS_Table::damagedCheck() const { return isDamaged() ? guard->check : nullptr; }

bool FS_Table::writeFailed() const { return guard != nullptr && guard->writeFailed; }

int FS_Table::writeError() const { return writeFailed() ? guard->writeError : 0; }

wchar_t const* FS_Table::failedWriteFile() const { return writeFailed() ? guard->writeFile.c_str() : nullptr; }

void FS_Table::clearWriteFailure() {
    if (guard == nullptr) return;
    guard->writeFailed = false;
    guard->writeError = 0;
    guard->writeFile.clear();
}

bool FS_Table::noteWriteFailure(wchar_t const* file) {
    int error = errno;
    if (guard != nullptr && !guard->writeFailed) {
        guard->writeFailed = true;
        guard->writeError = error;
        guard->writeFile = file != nullptr ? file : L"";
    }
    errno = error;
    return false;
}

bool FS_Table::noteDamage(wchar_t const* file, char const* check) {
    if (guard == nullptr) guard = new TableGuard();
    if (!guard->damaged) {
        guard->damaged = true;
        guard->file = file != nullptr ? file : L"";
        guard->check = check;
    }
    return false;
}

void FS_Table::setRowCheck(char const* (*check)(void* context, Fields& record), void* context) {
    // Without the guard nothing is checked, and a guard made here would
    // check reads against a header it never measured.
    if (guard == nullptr) return;
    guard->rowCheck = check;
    guard->rowCheckContext = context;
}

bool FS_Table::verify() {
    if (dataFile == nullptr || pointerFile == nullptr) return false;
    if (guard == nullptr) guard = new TableGuard();
    if (guard->damaged) return false;
    guard->indexes.clear();
    guard->reachedIndex = nullptr;
    for (TableGuard::ChainPosition& p : guard->chains) p.index = nullptr;
    guard->walking = false;
    guard->header = headerSize();

    uint32_t slotBytes = contentSize(pointerFile);
    if (slotBytes % kSlotSize != 0) return noteDamage(pointerPath, "pointer file size is not whole slots");
    uint32_t slots = slotBytes / kSlotSize;
    guard->slots = slots;
    guard->dataSize = contentSize(dataFile);
    // The first record, live or removed, starts right behind the header.
    uint32_t first = kRemovedSlot;
    if (slots != 0 && schema.count() != 0) {
        if (!readSlot(0, &first)) return noteDamage(pointerPath, "pointer file cannot be read");
        if (first != kRemovedSlot && !guardSlot(0, first)) return false;
    }
    uint32_t stored = 0, deleted = 0;
    if (!count(0, &stored) || !count(1, &deleted)) return noteDamage(dataPath, "header counts cannot be read");
    // The live slots are at most all slots: a larger stored count cannot be
    // their number, whatever the slots hold.
    if (stored > slots) return noteDamage(dataPath, "stored count differs from the live slots of the pointer file");
    if (static_cast<unsigned long long>(stored) + deleted != slots)
        return noteDamage(dataPath, "deleted count differs from the removed slots of the pointer file");

    for (Index* index : indexes) {
        wchar_t const* path = index->getIndexFullPathName();
        unsigned int total = 0;
        if (!index->slotCount(&total)) return noteDamage(path, "index file size is not whole slots");
        if (total < Index::BUCKETS) return noteDamage(path, "index file is shorter than its buckets");
        TableGuard::IndexBuckets entry;
        entry.index = index;
        entry.field = index->getFieldName() != nullptr ? index->getFieldName() : L"";
        entry.slots = total;
        guard->indexes.push_back(std::move(entry));
    }
    return true;
}

bool FS_Table::verifyWhole() {
    if (!verify()) return false;
    uint32_t dataSize = contentSize(dataFile);
    uint32_t slots = contentSize(pointerFile) / kSlotSize;
    unsigned int header = guard->header;

    // Live slots at rising offsets inside the records.
    uint32_t live = 0;
    uint32_t last = 0;
    if (!pointerFile->seek(0, SEEK_FROM_START)) return noteDamage(pointerPath, "pointer file cannot be read");
    const uint32_t block = 16384;
    std::vector<char> raw(static_cast<size_t>(block) * kSlotSize);
    for (uint32_t done = 0; done < slots;) {
        uint32_t n = slots - done < block ? slots - done : block;
        if (pointerFile->read(raw.data(), n * kSlotSize) != n * kSlotSize)
            return noteDamage(pointerPath, "pointer file cannot be read");
        for (uint32_t i = 0; i < n; ++i) {
            uint32_t offset = codec::decodeFixed32(raw.data() + i * kSlotSize);
            if (offset == kRemovedSlot) continue;
            ++live;
            // Records of a table without columns are empty and share offsets.
            if (schema.count() == 0) continue;
            if (offset < header || offset >= dataSize)
                return noteDamage(pointerPath, "slot points outside the records of the data file");
            if (live > 1 && offset <= last) return noteDamage(pointerPath, "slots do not point at rising offsets");
            last = offset;
        }
        done += n;
    }
    uint32_t stored = 0;
    if (!count(0, &stored)) return noteDamage(dataPath, "header counts cannot be read");
    if (stored != live) return noteDamage(dataPath, "stored count differs from the live slots of the pointer file");

    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (!verifyIndex(entry, slots)) return false;
    }
    return true;
}

bool FS_Table::verifyIndex(TableGuard::IndexBuckets& entry, uint32_t slots) {
    Index& index = *entry.index;
    wchar_t const* path = index.getIndexFullPathName();
    unsigned int total = 0;
    if (!index.slotCount(&total)) return noteDamage(path, "index file size is not whole slots");
    if (total < Index::BUCKETS) return noteDamage(path, "index file is shorter than its buckets");
    std::vector<char> spare;
    auto slotBytes = [&index, &spare](uint32_t first, uint32_t count) { return index.slotBytes(first, count, spare); };
    if (!indexChainsSound(slotBytes, total, slots, entry.bucketOf)) {
        // Damaged (or unreadable): walk the chains as a lookup would, to
        // name the damage a lookup meets first.
        std::vector<uint32_t> words(static_cast<size_t>(total) * 2);
        if (!index.readSlots(0, total, words.data())) return noteDamage(path, "index file cannot be read");
        char const* damage = indexChainsDamage(words, total, slots, entry.bucketOf);
        if (damage != nullptr) return noteDamage(path, damage);
    }
    entry.whole = true;
    return true;
}

char const* indexChainsDamage(const std::vector<uint32_t>& words, uint32_t total, uint32_t records,
                              BucketMap& bucketOf) {
    bucketOf.assignUnknown(records);
    std::vector<bool> reached(total - Index::BUCKETS, false);
    uint32_t entries = 0;
    uint32_t overflowReached = 0;
    for (uint32_t bucket = 0; bucket < Index::BUCKETS; ++bucket) {
        uint32_t slot = bucket;
        uint32_t id = words[static_cast<size_t>(slot) * 2];
        uint32_t next = words[static_cast<size_t>(slot) * 2 + 1];
        if (id == Index::EMPTY) {
            // A bucket is only ever chained behind a first entry.
            if (next != Index::EMPTY) return "empty bucket has a chain";
            continue;
        }
        for (;;) {
            if (id == Index::EMPTY) return "empty slot inside a chain";
            if (id >= records) return "index entry names a record past the pointer file";
            if (!bucketOf.fileOnce(id, bucket)) return "record filed twice in the index";
            ++entries;
            if (next == Index::EMPTY) break;
            // Overflow slots are appended and linked to older ones, so along
            // a chain their numbers fall; a link that does not is damage.
            if (next < Index::BUCKETS || next >= total || (slot >= Index::BUCKETS && next >= slot))
                return "chain link points outside the overflow slots";
            if (reached[next - Index::BUCKETS]) return "overflow slot is in two chains";
            reached[next - Index::BUCKETS] = true;
            ++overflowReached;
            slot = next;
            id = words[static_cast<size_t>(slot) * 2];
            next = words[static_cast<size_t>(slot) * 2 + 1];
        }
    }
    if (overflowReached != total - Index::BUCKETS) return "overflow slot outside every chain";
    if (entries != records) return "index does not hold every record number";
    return nullptr;
}

bool indexChainsSound(const std::function<const char*(uint32_t, uint32_t)>& slotBytes, uint32_t total,
                      uint32_t records, BucketMap& bucketOf) {
    if (total < Index::BUCKETS) return false;
    bucketOf.assignUnknown(records);
    // The bucket of each overflow slot's chain, set by the one slot that
    // links to it: buckets number 65536, so 16 bits hold one.
    static_assert(Index::BUCKETS <= 65536, "a bucket number fits 16 bits");
    const uint32_t overflow = total - Index::BUCKETS;
    // Read only where linked says it was written, so left uninitialised.
    std::unique_ptr<uint16_t[]> chainOf(new uint16_t[overflow != 0 ? overflow : 1]);
    // A bit a slot: this pass, too, is memory every large query clears anew.
    BitVector linked;
    linked.assign(overflow);
    uint32_t entries = 0;
    // One slot of a chain whose bucket is known: its record and its link.
    auto visit = [&](uint32_t slot, uint32_t bucket, uint32_t id, uint32_t next) {
        if (id == Index::EMPTY || id >= records || !bucketOf.fileOnce(id, bucket)) return false;
        ++entries;
        if (next == Index::EMPTY) return true;
        if (next < Index::BUCKETS || next >= total || (slot >= Index::BUCKETS && next >= slot)) return false;
        uint32_t o = next - Index::BUCKETS;
        if (!linked.testAndSet(o)) return false;
        chainOf[o] = static_cast<uint16_t>(bucket);
        return true;
    };
    const uint32_t block = 8192;  // slots per read
    // The two words of slot i of a block, as stored.
    auto word = [](const char* slots, uint32_t i, uint32_t k) {
        return codec::decodeFixed32(slots + static_cast<size_t>(i) * 8 + k * 4);
    };
    for (uint32_t first = 0; first < Index::BUCKETS; first += block) {
        uint32_t n = Index::BUCKETS - first < block ? Index::BUCKETS - first : block;
        const char* slots = slotBytes(first, n);
        if (slots == nullptr) return false;
        for (uint32_t i = 0; i < n; ++i) {
            uint32_t id = word(slots, i, 0), next = word(slots, i, 1);
            if (id == Index::EMPTY) {
                if (next != Index::EMPTY) return false;
                continue;
            }
            if (!visit(first + i, first + i, id, next)) return false;
        }
    }
    for (uint32_t end = total; end > Index::BUCKETS;) {
        uint32_t n = end - Index::BUCKETS < block ? end - Index::BUCKETS : block;
        uint32_t first = end - n;
        const char* slots = slotBytes(first, n);
        if (slots == nullptr) return false;
        for (uint32_t i = n; i-- > 0;) {
            uint32_t slot = first + i, o = slot - Index::BUCKETS;
            // Every slot that links here stands higher, or is a bucket.
            if (!linked.test(o)) return false;
            if (!visit(slot, chainOf[o], word(slots, i, 0), word(slots, i, 1))) return false;
        }
        end = first;
    }
    return entries == records;
}

bool FS_Table::guardSlot(unsigned int id, uint32_t offset) {
    // Records of a table without columns are empty and share offsets.
    if (schema.count() == 0 || offset == kRemovedSlot) return true;
    if (id == 0 && offset != guard->header)
        return noteDamage(pointerPath, "first record does not start behind the header");
    if (offset < guard->header || !insideData(offset))
        return noteDamage(pointerPath, "slot points outside the records of the data file");
    return true;
}

bool FS_Table::insideData(uint32_t offset) {
    if (offset < guard->dataSize) return true;
    guard->dataSize = contentSize(dataFile);
    return offset < guard->dataSize;
}

bool FS_Table::insidePointers(uint32_t id) {
    if (id < guard->slots) return true;
    guard->slots = contentSize(pointerFile) / kSlotSize;
    return id < guard->slots;
}

bool FS_Table::insideIndex(Index& index, uint32_t slot) {
    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (entry.index != &index) continue;
        if (slot < entry.slots) return true;
        unsigned int total = 0;
        entry.slots = index.slotCount(&total) ? total : 0;
        return slot < entry.slots;
    }
    unsigned int total = 0;
    return index.slotCount(&total) && slot < total;
}

bool FS_Table::guardChainSlot(Index& index, uint32_t slot, uint32_t id, uint32_t next) {
    wchar_t const* path = index.getIndexFullPathName();
    if (id == Index::EMPTY) {
        // A bucket is only ever chained behind a first entry; an overflow
        // slot is only ever written with one.
        if (slot >= Index::BUCKETS) return noteDamage(path, "empty slot inside a chain");
        if (next != Index::EMPTY) return noteDamage(path, "empty bucket has a chain");
        return true;
    }
    if (!insidePointers(id)) return noteDamage(path, "index entry names a record past the pointer file");
    if (next == Index::EMPTY) return true;
    // Overflow slots are appended and linked to older ones, so along a chain
    // their numbers fall: this also bounds every walk along a chain.
    if (next < Index::BUCKETS || !insideIndex(index, next) || (slot >= Index::BUCKETS && next >= slot))
        return noteDamage(path, "chain link points outside the overflow slots");
    return true;
}

void FS_Table::guardChainAt(Index& index, uint32_t next, uint32_t bucket) {
    if (next == Index::EMPTY) return;
    for (TableGuard::ChainPosition& p : guard->chains) {
        if (p.index == &index && p.next == next) {
            p.bucket = bucket;
            return;
        }
    }
    TableGuard::ChainPosition& p = guard->chains[guard->nextChain];
    guard->nextChain = (guard->nextChain + 1) % TableGuard::CHAIN_POSITIONS;
    p.index = &index;
    p.next = next;
    p.bucket = bucket;
}

bool FS_Table::guardChainBucket(Index& index, uint32_t next, uint32_t* bucket) {
    for (TableGuard::ChainPosition& p : guard->chains) {
        if (p.index == &index && p.next == next) {
            *bucket = p.bucket;
            // The lookup moves on: the slot is not a position any more.
            p.index = nullptr;
            return true;
        }
    }
    return false;
}

void FS_Table::guardReached(Index* index, uint32_t id, uint32_t bucket) {
    guard->reachedIndex = index;
    guard->reachedId = id;
    guard->reachedBucket = bucket;
}

bool FS_Table::guardFiled(TableGuard::IndexBuckets& entry, unsigned int id, uint32_t bucket) {
    char const* const misfiled = "record does not hold the key its index entry is filed under";
    Index& index = *entry.index;
    if (guard->reachedIndex == &index && guard->reachedId == id)
        return bucket == guard->reachedBucket || noteDamage(index.getIndexFullPathName(), misfiled);
    // A walk over the pointer file checks the keys of every row it reads:
    // the whole index, read once in order, costs less than the chains of a
    // few rows, each link a jump to another page of the file.
    if (!entry.whole && (guard->walking || entry.searched > searchBudget(entry.slots)) &&
        !verifyIndex(entry, contentSize(pointerFile) / kSlotSize))
        return false;
    if (entry.whole) return entry.holds(id, bucket) || noteDamage(index.getIndexFullPathName(), misfiled);
    // The record's number must be on its key's chain.  Every link is checked
    // before it is followed, so the walk ends within the index's slots.
    uint32_t slot = bucket;
    for (;;) {
        uint32_t candidate, next;
        ++entry.searched;
        if (!index.read(slot, &candidate, &next)) return noteDamage(index.getIndexFullPathName(), "index file cannot be read");
        if (!guardChainSlot(index, slot, candidate, next)) return false;
        if (candidate == id) return true;
        if (candidate == Index::EMPTY || next == Index::EMPTY) return noteDamage(index.getIndexFullPathName(), misfiled);
        slot = next;
    }
}

bool FS_Table::isCurrent(Index const* index) const {
    for (Index* mine : indexes)
        if (mine == index) return true;
    return false;
}

bool FS_Table::guardKeys(unsigned int id, Fields& record) {
    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (!isCurrent(entry.index)) continue;
        int bucket = keyBucket(record.name(entry.field.c_str()));
        if (bucket >= 0 && !guardFiled(entry, id, static_cast<uint32_t>(bucket))) return false;
    }
    return true;
}

void FS_Table::guardWalkStart(uint32_t firstOffset) {
    guard->walking = true;
    guard->walkAt = 0;
    guard->walkLive = firstOffset != kRemovedSlot ? 1 : 0;
    guard->walkLastOffset = firstOffset;
}

bool FS_Table::guardWalkLive(unsigned int id, uint32_t offset) {
    ++guard->walkLive;
    guard->walkAt = id;
    if (schema.count() == 0) return true;
    if (offset < guard->header || !insideData(offset)) {
        guard->walking = false;
        return noteDamage(pointerPath, "slot points outside the records of the data file");
    }
    if (guard->walkLive > 1 && offset <= guard->walkLastOffset) {
        guard->walking = false;
        return noteDamage(pointerPath, "slots do not point at rising offsets");
    }
    guard->walkLastOffset = offset;
    return true;
}

bool FS_Table::guardWalkEnd() {
    guard->walking = false;
    uint32_t stored = 0;
    if (!count(0, &stored)) return noteDamage(dataPath, "header counts cannot be read");
    if (stored != guard->walkLive)
        return noteDamage(dataPath, "stored count differs from the live slots of the pointer file");
    return true;
}

bool FS_Table::guardedRead(unsigned int id, Fields& record) {
    if (guard->damaged) return false;
    uint32_t offset = kRemovedSlot;
    // Closed table, a number past the pointer file, a removed slot: as the
    // unguarded read answers them.
    if (dataFile == nullptr || pointerFile == nullptr || !readSlot(id, &offset) || offset == kRemovedSlot)
        return readRecord(id, record);
    if (!guardSlot(id, offset)) return false;
    if (!readRecord(id, record)) {
        // A type-6 column is never stored, so its read fails on any record.
        for (unsigned int i = 0; i < record.count(); ++i)
            if (record.at(i)->getType() == FIELD_HEX) return false;
        return noteDamage(dataPath, "record runs past the end of the data file");
    }
    // Only a buffer of the table's own columns reads a record to its end.
    if (record.count() != schema.count()) return true;
    uint32_t end = static_cast<uint32_t>(dataFile->tell());
    uint32_t nextOffset = kRemovedSlot;
    if (id != 0xFFFFFFFFu && readSlot(id + 1, &nextOffset) && nextOffset != kRemovedSlot && nextOffset != end)
        return noteDamage(dataPath, "record does not end where the next record starts");
    if (!guardKeys(id, record)) return false;
    if (guard->rowCheck != nullptr) {
        char const* failed = guard->rowCheck(guard->rowCheckContext, record);
        if (failed != nullptr) return noteDamage(dataPath, failed);
    }
    return true;
}

void FS_Table::guardInsert(Fields& record, unsigned int id) {
    // The walk's count no longer matches what it has seen.
    guard->walking = false;
    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (!entry.whole) continue;
        if (id == 0xFFFFFFFFu) continue;  // no pointer file reaches it
        if (entry.bucketOf.size() <= id) entry.bucketOf.grow(id + 1);
        int bucket = keyBucket(record.name(entry.field.c_str()));
        entry.bucketOf.set(id, bucket >= 0 ? static_cast<uint32_t>(bucket) : BucketMap::UNKNOWN);
    }
}
