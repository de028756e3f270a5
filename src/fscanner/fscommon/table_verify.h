// State of a table's integrity guard (FS_Table::verify): the first damage
// found, what the reads have learnt of each hash index, the lookup that
// handed out the record being read, and the walk over the pointer file in
// progress.  The guard checks each read on what that read relies on, so
// that a query that reads a few rows pays for a few rows.
#ifndef FSCANNER_FSCOMMON_TABLE_VERIFY_H
#define FSCANNER_FSCOMMON_TABLE_VERIFY_H

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

class Fields;
class Index;

// A bit a number, all clear at first: the whole check's marks, an eighth of
// the bytes a flag each would take.
class BitVector {
public:
    // bits numbers, all clear.
    void assign(uint32_t bits) { words.assign((static_cast<size_t>(bits) + 63) / 64, 0); }
    // Grows to bits numbers; the new ones clear.
    void grow(uint32_t bits) { words.resize((static_cast<size_t>(bits) + 63) / 64, 0); }
    bool test(uint32_t i) const { return ((words[i / 64] >> (i % 64)) & 1) != 0; }
    // Sets bit i; false when it was set already.
    bool testAndSet(uint32_t i) {
        uint64_t& word = words[i / 64];
        uint64_t bit = static_cast<uint64_t>(1) << (i % 64);
        if ((word & bit) != 0) return false;
        word |= bit;
        return true;
    }
    // Clears bit i; false when it was clear already.
    bool testAndClear(uint32_t i) {
        uint64_t& word = words[i / 64];
        uint64_t bit = static_cast<uint64_t>(1) << (i % 64);
        if ((word & bit) == 0) return false;
        word &= ~bit;
        return true;
    }
    bool operator==(const BitVector& other) const { return words == other.words; }

private:
    std::vector<uint64_t> words;
};

// The bucket each record number of a table is filed under in one index:
// two bytes a record, since buckets number 65536, and a bit for the records
// filed nowhere.  A query that reads every row fills and reads one of these
// per index, so its size is pages that are faulted in and cleared anew by
// every such query: plain words would be twice as many.
class BucketMap {
public:
    // A record number with no entry in an index (its field was null at
    // insert) has this bucket, and its key is not checked.
    static constexpr uint32_t UNKNOWN = 0xFFFFFFFFu;

    // records numbers, none filed.
    void assignUnknown(uint32_t records);
    // Grows to records numbers; the new ones are filed nowhere.
    void grow(uint32_t records);
    uint32_t size() const { return static_cast<uint32_t>(buckets.size()); }
    // UNKNOWN for a number filed nowhere or past the end.
    uint32_t at(uint32_t id) const {
        if (id >= buckets.size()) return UNKNOWN;
        // A sound index files every record: the bits need no look then.
        if (unfiled != 0 && !filed.test(id)) return UNKNOWN;
        return buckets[id];
    }
    // bucket is below 65536, or UNKNOWN; id is below size().
    void set(uint32_t id, uint32_t bucket) {
        if (bucket == UNKNOWN) {
            if (filed.testAndClear(id)) ++unfiled;
            buckets[id] = 0;
        } else {
            if (filed.testAndSet(id)) --unfiled;
            buckets[id] = static_cast<uint16_t>(bucket);
        }
    }
    // Files id (below size()) under bucket (below 65536) unless it is filed
    // already: false then, and nothing changes.
    bool fileOnce(uint32_t id, uint32_t bucket) {
        if (!filed.testAndSet(id)) return false;
        --unfiled;
        buckets[id] = static_cast<uint16_t>(bucket);
        return true;
    }
    bool operator==(const BucketMap& other) const { return buckets == other.buckets && filed == other.filed; }

private:
    std::vector<uint16_t> buckets;  // 0 where not filed
    BitVector filed;                // bit id: buckets[id] holds its bucket
    uint32_t unfiled = 0;           // numbers below size() whose bit is clear
};

struct TableGuard {
    static constexpr uint32_t UNKNOWN_BUCKET = BucketMap::UNKNOWN;

    struct IndexBuckets {
        // Compared only, never followed unless the table's own list still
        // holds it: that list says which indexes are still there.
        Index* index;
        std::wstring field;
        // Chain slots walked so far to find a read record under its key.
        // Past a share of the index's size the whole index is checked once
        // and bucketOf answers from then on: a query that reads every row
        // pays for the index once, not a chain per row.
        uint64_t searched = 0;
        bool whole = false;
        // Slots of the index file when last measured: files only grow while
        // open, so a slot below it needs no new measure.
        uint32_t slots = 0;
        // Valid when whole: the bucket each record number is filed under.
        BucketMap bucketOf;
        // When whole: record id, whose key falls in bucket, is filed there
        // (or has no entry).
        bool holds(uint32_t id, uint32_t bucket) const {
            uint32_t filed = bucketOf.at(id);
            return filed == UNKNOWN_BUCKET || filed == bucket;
        }
    };

    // Where a chain being walked by a lookup came from: the overflow slot
    // the lookup goes on with, and the bucket whose chain it belongs to.  In
    // a sound index every overflow slot is in one chain only, so the pair
    // (index, slot) names the bucket of a record met there; damage that puts
    // a slot into two chains shows as a key that hashes elsewhere.
    struct ChainPosition {
        Index* index = nullptr;
        uint32_t next = 0;
        uint32_t bucket = 0;
    };
    static const unsigned int CHAIN_POSITIONS = 8;

    // headerSize() of the table, kept while it is open: the schema does not
    // change under an open table.
    uint32_t header = 0;
    // Sizes of the data file in bytes and of the pointer file in slots when
    // last measured; measured again only when a check reaches past them.
    uint32_t dataSize = 0;
    uint32_t slots = 0;

    bool damaged = false;
    std::wstring file;
    char const* check = nullptr;
    // The first write the disk refused (FS_Table::writeFailed), with the
    // errno it left and the file.
    bool writeFailed = false;
    int writeError = 0;
    std::wstring writeFile;
    std::vector<IndexBuckets> indexes;

    // The record the last lookup handed out and the bucket it was met under.
    Index* reachedIndex = nullptr;
    uint32_t reachedId = 0;
    uint32_t reachedBucket = 0;
    ChainPosition chains[CHAIN_POSITIONS];
    unsigned int nextChain = 0;

    // A walk with moveFirst and moveNext over the whole pointer file: the
    // last number it stood on, its live slots and the last live offset.  Any
    // change to the table, or a move that does not continue it, ends the
    // walk's bookkeeping; one that reaches the end checks the stored count.
    bool walking = false;
    uint32_t walkAt = 0;
    uint32_t walkLive = 0;
    uint32_t walkLastOffset = 0;

    // The owner's check of every record read whole (FS_Table::setRowCheck).
    char const* (*rowCheck)(void* context, Fields& record) = nullptr;
    void* rowCheckContext = nullptr;
};

// The whole check of one hash index of total slots (Index::BUCKETS bucket
// slots, then overflow slots; two words per slot: record number, next
// slot) against a table of records record numbers.  Both fill bucketOf
// with the bucket each record number is filed under when the index is
// sound, and accept exactly the same indexes.
//
// indexChainsDamage walks the chains bucket by bucket, as a lookup does,
// and names the first damage it meets (nullptr when sound); it needs every
// slot in words.  indexChainsSound says only whether the index is sound,
// reading it through slotBytes (first slot, count: the slots' bytes as
// stored, or null when they cannot be read) in blocks: the
// buckets first, then the overflow slots from the last down.  A link only
// ever leads to a lower overflow slot, so every slot's bucket is known
// before the pass reaches it, and the pass touches memory in order instead
// of jumping along chains, which on a large index is a cache miss a slot.
char const* indexChainsDamage(const std::vector<uint32_t>& words, uint32_t total, uint32_t records,
                              BucketMap& bucketOf);
bool indexChainsSound(const std::function<const char*(uint32_t, uint32_t)>& slotBytes, uint32_t total,
                      uint32_t records, BucketMap& bucketOf);

#endif
