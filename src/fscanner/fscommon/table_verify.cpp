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
// A crash breaks some of these (padding, a count behind its slot): a table
// left by a crash is never verified, since the cache refuses it by its
// update flag before.
#include <cerrno>
#include <cstring>
#include <cwchar>
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

// ---- Index -------------------------------------------------------------------

bool Index::slotCount(unsigned int* count) {
    if (file == nullptr) return false;
    uint32_t bytes = contentSize(file);
    if (bytes % 8 != 0) return false;
    *count = bytes / 8;
    return true;
}

bool Index::readSlots(unsigned int first, unsigned int count, uint32_t* words) {
    if (file == nullptr) return false;
    if (!file->seek(static_cast<long>(static_cast<unsigned long long>(first) * 8), SEEK_FROM_START)) return false;
    const unsigned int block = 8192;  // slots per read
    std::vector<char> raw(static_cast<size_t>(block) * 8);
    for (unsigned int done = 0; done < count;) {
        unsigned int n = count - done < block ? count - done : block;
        if (file->read(raw.data(), n * 8) != n * 8) return false;
        for (unsigned int i = 0; i < n * 2; ++i) words[static_cast<size_t>(done) * 2 + i] = codec::decodeFixed32(raw.data() + i * 4);
        done += n;
    }
    return true;
}

// ---- FS_Table ----------------------------------------------------------------

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

bool FS_Table::verify() {
    if (dataFile == nullptr || pointerFile == nullptr) return false;
    if (guard == nullptr) guard = new TableGuard();
    if (guard->damaged) return false;
    guard->indexes.clear();

    uint32_t dataSize = contentSize(dataFile);
    uint32_t slotBytes = contentSize(pointerFile);
    if (slotBytes % kSlotSize != 0) return noteDamage(pointerPath, "pointer file size is not whole slots");
    uint32_t slots = slotBytes / kSlotSize;
    unsigned int header = headerSize();

    // Live slots at rising offsets inside the records; slot 0's record, live
    // or removed, starts right behind the header.
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
            if (done + i == 0 && offset != header)
                return noteDamage(pointerPath, "first record does not start behind the header");
            if (offset < header || offset >= dataSize)
                return noteDamage(pointerPath, "slot points outside the records of the data file");
            if (live > 1 && offset <= last) return noteDamage(pointerPath, "slots do not point at rising offsets");
            last = offset;
        }
        done += n;
    }
    uint32_t stored = 0, deleted = 0;
    if (!count(0, &stored) || !count(1, &deleted)) return noteDamage(dataPath, "header counts cannot be read");
    if (stored != live) return noteDamage(dataPath, "stored count differs from the live slots of the pointer file");
    if (static_cast<unsigned long long>(stored) + deleted != slots)
        return noteDamage(dataPath, "deleted count differs from the removed slots of the pointer file");

    for (Index* index : indexes) {
        if (!verifyIndex(*index, slots)) return false;
    }
    return true;
}

bool FS_Table::verifyIndex(Index& index, uint32_t slots) {
    wchar_t const* path = index.getIndexFullPathName();
    unsigned int total = 0;
    if (!index.slotCount(&total)) return noteDamage(path, "index file size is not whole slots");
    if (total < Index::BUCKETS) return noteDamage(path, "index file is shorter than its buckets");
    std::vector<uint32_t> words(static_cast<size_t>(total) * 2);
    if (!index.readSlots(0, total, words.data())) return noteDamage(path, "index file cannot be read");

    TableGuard::IndexBuckets entry;
    entry.index = &index;
    entry.field = index.getFieldName() != nullptr ? index.getFieldName() : L"";
    entry.bucketOf.assign(slots, TableGuard::UNKNOWN_BUCKET);
    std::vector<bool> reached(total - Index::BUCKETS, false);
    uint32_t entries = 0;
    uint32_t overflowReached = 0;
    for (uint32_t bucket = 0; bucket < Index::BUCKETS; ++bucket) {
        uint32_t slot = bucket;
        uint32_t id = words[static_cast<size_t>(slot) * 2];
        uint32_t next = words[static_cast<size_t>(slot) * 2 + 1];
        if (id == Index::EMPTY) {
            // A bucket is only ever chained behind a first entry.
            if (next != Index::EMPTY) return noteDamage(path, "empty bucket has a chain");
            continue;
        }
        for (;;) {
            if (id == Index::EMPTY) return noteDamage(path, "empty slot inside a chain");
            if (id >= slots) return noteDamage(path, "index entry names a record past the pointer file");
            if (entry.bucketOf[id] != TableGuard::UNKNOWN_BUCKET)
                return noteDamage(path, "record filed twice in the index");
            entry.bucketOf[id] = bucket;
            ++entries;
            if (next == Index::EMPTY) break;
            // Overflow slots are appended and linked to older ones, so along
            // a chain their numbers fall; a link that does not is damage.
            if (next < Index::BUCKETS || next >= total || (slot >= Index::BUCKETS && next >= slot))
                return noteDamage(path, "chain link points outside the overflow slots");
            if (reached[next - Index::BUCKETS]) return noteDamage(path, "overflow slot is in two chains");
            reached[next - Index::BUCKETS] = true;
            ++overflowReached;
            slot = next;
            id = words[static_cast<size_t>(slot) * 2];
            next = words[static_cast<size_t>(slot) * 2 + 1];
        }
    }
    if (overflowReached != total - Index::BUCKETS) return noteDamage(path, "overflow slot outside every chain");
    if (entries != slots) return noteDamage(path, "index does not hold every record number");
    guard->indexes.push_back(std::move(entry));
    return true;
}

bool FS_Table::guardedRead(unsigned int id, Fields& record) {
    if (guard->damaged) return false;
    uint32_t offset = kRemovedSlot;
    // Closed table, a number past the pointer file, a removed slot: as the
    // unguarded read answers them.
    if (dataFile == nullptr || pointerFile == nullptr || !readSlot(id, &offset) || offset == kRemovedSlot)
        return readRecord(id, record);
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
    for (TableGuard::IndexBuckets const& entry : guard->indexes) {
        if (id >= entry.bucketOf.size() || entry.bucketOf[id] == TableGuard::UNKNOWN_BUCKET) continue;
        bool current = false;
        for (Index* index : indexes) current = current || index == entry.index;
        if (!current) continue;
        int bucket = keyBucket(record.name(entry.field.c_str()));
        if (bucket >= 0 && static_cast<uint32_t>(bucket) != entry.bucketOf[id])
            return noteDamage(entry.index->getIndexFullPathName(),
                              "record does not hold the key its index entry is filed under");
    }
    return true;
}

void FS_Table::guardInsert(Fields& record, unsigned int id) {
    for (TableGuard::IndexBuckets& entry : guard->indexes) {
        if (entry.bucketOf.size() <= id) entry.bucketOf.resize(static_cast<size_t>(id) + 1, TableGuard::UNKNOWN_BUCKET);
        int bucket = keyBucket(record.name(entry.field.c_str()));
        entry.bucketOf[id] = bucket >= 0 ? static_cast<uint32_t>(bucket) : TableGuard::UNKNOWN_BUCKET;
    }
}
