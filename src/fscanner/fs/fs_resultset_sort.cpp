#include "fscanner/fs/fs_resultset_sort.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <cwctype>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"
#include "fscanner/fs/fs_fileinfo.h"
#include "fscanner/fs/fs_serializer.h"
#include "fscanner/fscommon/codec.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/expvalue.h"
#include "fscanner/fscommon/sysfile.h"
#include "fscanner/fscommon/utils.h"
#include "fscanner/fscommon/wildcard.h"

namespace {

// The sort in memory writes its file in pieces of this size.
const size_t kWriteBuffer = 1 << 20;

// ---- the sort in memory -------------------------------------------------------
//
// A result file within NaturalMergeReplay's limit is read whole; every record
// gets a number that orders it as FsFileInfo::compare orders it for the key
// (equal numbers for records compare finds equal); the replay gives the order
// that the passes on disk would leave, ties included; and the file is written
// once, in that order: one read and one write of the file, where the passes
// read and write every record twice per pass.
//
// The order must be the passes' own, which is not a stable sort (runs join in
// a scratch file), and every byte must be the one the passes would write.
// Both follow from what loading and saving do to a record:
//  - A record whose four strings are shortest-form UTF-8 of characters 1 to
//    0x10FFFF, or missing (count 0), reads back as it is written: its bytes
//    go out unchanged, and its key is its UTF-8, which orders as wcscmp
//    orders the characters.  Almost every record is such a record.
//  - Any other record goes through FsFileInfo::loadObject and saveObject as
//    on disk: its key as first read and its key once written may differ, and
//    saveObject refuses one with a missing string (the passes then drop it
//    at their first write).
// Keys are compared as byte strings that order as the wide strings do:
// UTF-8 (in its original form up to 31 bits), of the characters lowered by
// towlower when the case is ignored, as wcscasecmp lowers them.  A character
// from the sign range of wchar_t (only damaged bytes decode to one) has no
// such form: such a file goes to the passes on disk.

// The state of one string of a record as it lies in the file.
const uint8_t kTextMissing = 0;  // count 0: the loader gives null
const uint8_t kTextPlain = 1;    // loads and saves back to the same bytes
const uint8_t kTextOther = 2;    // only the loader knows what it reads

// What the sort needs of a record as it lies in the file.  The path's bytes
// follow the record's first count; the name's follow the path and its count.
struct StoredRecord {
    uint64_t size;  // 0 when the record has none, as loadObject leaves it
    uint32_t offset;
    uint32_t length;
    uint32_t pathLength;
    uint32_t nameLength;
    uint8_t pathState;
    uint8_t nameState;
    bool plain;     // no string is kTextOther: the bytes are what the passes write
    bool complete;  // no string is missing: saveObject accepts the record
    uint32_t pathOffset() const { return offset + resultfile::kStringCountSize; }
    uint32_t nameOffset() const { return pathOffset() + pathLength + resultfile::kStringCountSize; }
};

// The character that starts at p in plain UTF-8 (see plainUtf8) into *c;
// gives the bytes it takes.
size_t plainCharacter(const unsigned char* p, uint32_t* c) {
    unsigned char lead = p[0];
    size_t extra;
    if (lead < 0x80) {
        *c = lead;
        return 1;
    } else if (lead < 0xE0) {
        *c = lead & 0x1F;
        extra = 1;
    } else if (lead < 0xF0) {
        *c = lead & 0x0F;
        extra = 2;
    } else {
        *c = lead & 0x07;
        extra = 3;
    }
    for (size_t k = 1; k <= extra; ++k) *c = (*c << 6) | (p[k] & 0x3F);
    return extra + 1;
}

// True when bytes is shortest-form UTF-8 of characters 1 to 0x10FFFF: the
// lenient decoder reads exactly those characters from it, and stringToUTF8
// writes exactly these bytes for them.  Surrogate code points pass: both
// sides treat them as ordinary three-byte characters.
bool plainUtf8(const unsigned char* p, size_t n) {
    size_t i = 0;
    while (i < n) {
        // Eight ASCII bytes at a time, none of them NUL.
        while (i + 8 <= n) {
            uint64_t word;
            std::memcpy(&word, p + i, 8);
            const uint64_t high = 0x8080808080808080ull;
            if ((word & high) != 0 || ((word - 0x0101010101010101ull) & ~word & high) != 0) break;
            i += 8;
        }
        if (i >= n) break;
        unsigned char c = p[i];
        if (c == 0) return false;
        if (c < 0x80) {
            ++i;
            continue;
        }
        size_t extra;
        unsigned char low = 0x80;   // bounds of the first continuation byte
        unsigned char high = 0xBF;
        if (c < 0xC2) {
            return false;  // a stray continuation, or an overlong two-byte form
        } else if (c < 0xE0) {
            extra = 1;
        } else if (c < 0xF0) {
            extra = 2;
            if (c == 0xE0) low = 0xA0;
        } else if (c < 0xF5) {
            extra = 3;
            if (c == 0xF0) low = 0x90;
            if (c == 0xF4) high = 0x8F;
        } else {
            return false;
        }
        if (n - i <= extra) return false;
        if (p[i + 1] < low || p[i + 1] > high) return false;
        for (size_t k = 2; k <= extra; ++k) {
            if ((p[i + k] & 0xC0) != 0x80) return false;
        }
        i += extra + 1;
    }
    return true;
}

// Reads the record at offset `at` of a file of `end` bytes as loadObject
// would, without building it: false exactly where loadObject fails, when
// the file ends inside the record.
bool parseStoredRecord(const unsigned char* file, size_t end, size_t at, StoredRecord& record) {
    size_t position = at;
    record.pathLength = record.nameLength = 0;
    record.pathState = record.nameState = kTextMissing;
    record.plain = true;
    record.complete = true;
    for (int text = 0; text < 4; ++text) {  // path, name, md5, sha256
        if (end - position < resultfile::kStringCountSize) return false;
        uint32_t count = codec::decodeBig32(reinterpret_cast<const char*>(file + position));
        position += resultfile::kStringCountSize;
        uint32_t length = count == 0 ? 0 : count - 1;
        if (end - position < length) return false;
        uint8_t state = count == 0                                ? kTextMissing
                        : plainUtf8(file + position, length) ? kTextPlain
                                                                  : kTextOther;
        if (state == kTextMissing) record.complete = false;
        if (state == kTextOther) record.plain = false;
        if (text == 0) {
            record.pathLength = length;
            record.pathState = state;
        } else if (text == 1) {
            record.nameLength = length;
            record.nameState = state;
        }
        position += length;
    }
    if (end - position < resultfile::kUnsigned32Size) return false;
    uint32_t mask = codec::decodeBig32(reinterpret_cast<const char*>(file + position));
    position += resultfile::kUnsigned32Size;
    // The fields behind the mask, in rising bit order, for its twelve low
    // bits: the size is the one 64-bit field, the others are 32-bit.
    uint32_t present = mask & 0xFFF;
    size_t fields = 0;
    for (uint32_t rest = present; rest != 0; rest &= rest - 1) fields += resultfile::kUnsigned32Size;
    if (present & FsFileInfo::VALID_SIZE) fields += resultfile::kUnsigned64Size - resultfile::kUnsigned32Size;
    if (end - position < fields) return false;
    record.size = 0;
    if (present & FsFileInfo::VALID_SIZE) {
        size_t at64 = position + ((present & FsFileInfo::VALID_ATTR) ? resultfile::kUnsigned32Size : 0);
        record.size = codec::decodeBig64(reinterpret_cast<const char*>(file + at64));
    }
    position += fields;
    record.offset = static_cast<uint32_t>(at);
    record.length = static_cast<uint32_t>(position - at);
    return true;
}

// A read-only AbstractFile over bytes in memory, or a write-only one that
// appends to a string, with LinuxMmFile's reading rules: a read past the end
// copies what remains and sets the end flag, a full read clears it.  Lets
// FsSerializator_OnFile load and save single records in memory.
class MemoryFile : public AbstractFile {
public:
    MemoryFile(const unsigned char* bytes, size_t length)
        : data(bytes), dataLength(length), output(nullptr), position(0), atEnd(false) {}
    explicit MemoryFile(std::string* sink)
        : data(nullptr), dataLength(0), output(sink), position(0), atEnd(false) {}
    bool create() override { return false; }
    bool open() override { return false; }
    bool close() override { return true; }
    unsigned int read(void* buffer, unsigned int length) override {
        size_t available = position < dataLength ? dataLength - position : 0;
        size_t copied = length <= available ? length : available;
        atEnd = length > available;
        if (copied != 0) std::memcpy(buffer, data + position, copied);
        position += copied;
        return static_cast<unsigned int>(copied);
    }
    unsigned int write(void* buffer, unsigned int length) override {
        if (output == nullptr) return 0;
        output->append(static_cast<const char*>(buffer), length);
        return length;
    }
    bool seek(long offset, int origin) override {
        atEnd = false;
        long long base = origin == SEEK_FROM_START ? 0
                         : origin == SEEK_FROM_CURRENT ? static_cast<long long>(position)
                         : origin == SEEK_FROM_END ? static_cast<long long>(dataLength)
                                                   : -1;
        if (base < 0) return false;
        long long target = base + offset;
        if (target < 0 || target > static_cast<long long>(dataLength)) return false;
        position = static_cast<size_t>(target);
        return true;
    }
    long tell() override { return static_cast<long>(position); }
    bool eof() override { return atEnd; }
    bool size(unsigned int* result) override {
        *result = static_cast<unsigned int>(dataLength);
        return true;
    }

private:
    const unsigned char* data;
    size_t dataLength;
    std::string* output;
    size_t position;
    bool atEnd;
};

// What the passes make of a record that is not plain: loaded from its bytes
// (the key the first distribution sees), saved (the bytes every later pass
// reads; none when saveObject refuses it), and loaded from those again (the
// key of every later comparison).
struct ReloadedRecord {
    FsFileInfo asRead;
    FsFileInfo asWritten;
    std::string written;
    bool kept;
};

void reloadRecord(const unsigned char* bytes, size_t length, ReloadedRecord& out) {
    MemoryFile in(bytes, length);
    FsSerializator_OnFile reader(&in, false);
    out.asRead.loadObject(reader);
    out.written.clear();
    MemoryFile sink(&out.written);
    FsSerializator_OnFile writer(&sink, false);
    out.kept = out.asRead.saveObject(writer) == 0;
    if (!out.kept) return;
    MemoryFile again(reinterpret_cast<const unsigned char*>(out.written.data()), out.written.size());
    FsSerializator_OnFile rereader(&again, false);
    out.asWritten.loadObject(rereader);
}

// Where a string key's bytes are: a head, and for full paths a separator and
// a tail.  The bytes lie in the file or in the key arena.
struct KeyText {
    const unsigned char* head;
    const unsigned char* tail;
    uint32_t headLength;
    uint32_t tailLength;
    bool separator;
    size_t length() const { return static_cast<size_t>(headLength) + (separator ? 1 : 0) + tailLength; }
    // Bytes every key with this head has in common: the head and separator.
    size_t shared() const { return static_cast<size_t>(headLength) + (separator ? 1 : 0); }
};

// Blocks that hold the keys built here (lowered, or from records that are
// not plain).  A key never moves once written.
class KeyArena {
public:
    unsigned char* allocate(size_t length) {
        if (length > kBlock) {
            blocks.emplace_back(new unsigned char[length]);
            lastIsShared = false;
            return blocks.back().get();
        }
        if (blocks.empty() || used + length > kBlock || !lastIsShared) {
            blocks.emplace_back(new unsigned char[kBlock]);
            lastIsShared = true;
            used = 0;
        }
        unsigned char* result = blocks.back().get() + used;
        used += length;
        return result;
    }

private:
    static constexpr size_t kBlock = 1 << 20;
    std::vector<std::unique_ptr<unsigned char[]>> blocks;
    size_t used = 0;
    bool lastIsShared = false;
};

// UTF-8 in its original form, up to six bytes for 31 bits: byte strings of
// such forms compare as the character strings do.  Gives the bytes written.
size_t putKeyCharacter(uint32_t c, unsigned char* out) {
    if (c < 0x80) {
        out[0] = static_cast<unsigned char>(c);
        return 1;
    }
    int extra = c < 0x800 ? 1 : c < 0x10000 ? 2 : c < 0x200000 ? 3 : c < 0x4000000 ? 4 : 5;
    static const unsigned char kLead[] = {0, 0xC0, 0xE0, 0xF0, 0xF8, 0xFC};
    out[0] = static_cast<unsigned char>(kLead[extra] | (c >> (6 * extra)));
    for (int k = 1; k <= extra; ++k) {
        out[k] = static_cast<unsigned char>(0x80 | ((c >> (6 * (extra - k))) & 0x3F));
    }
    return static_cast<size_t>(extra) + 1;
}

const size_t kMaxKeyCharacterBytes = 6;
const uint32_t kSignBit = 0x80000000u;

// Builds key bytes from characters, lowered when the case is ignored.
// False for a character that has no order-keeping form (see above).
class KeyBuilder {
public:
    explicit KeyBuilder(bool caseSensitive) : caseSensitive(caseSensitive) {
        // towlower of the ASCII characters, asked once: the locale decides
        // them too (a Turkish one lowers 'I' to a dotless i).
        for (uint32_t c = 0; c < 0x80; ++c) {
            lowerAscii[c] = caseSensitive ? c : static_cast<uint32_t>(std::towlower(static_cast<wint_t>(c)));
        }
    }
    void clear() { bytes.clear(); }
    bool add(uint32_t c) {
        if (c < 0x80) {
            c = lowerAscii[c];
            if (c < 0x80) {
                bytes.push_back(static_cast<unsigned char>(c));
                return true;
            }
        } else if (!caseSensitive) {
            c = static_cast<uint32_t>(std::towlower(static_cast<wint_t>(c)));
        }
        if (c & kSignBit) return false;
        unsigned char encoded[kMaxKeyCharacterBytes];
        size_t n = putKeyCharacter(c, encoded);
        bytes.insert(bytes.end(), encoded, encoded + n);
        return true;
    }
    bool addWide(const wchar_t* text) {
        for (; *text != 0; ++text) {
            if (!add(static_cast<uint32_t>(*text))) return false;
        }
        return true;
    }
    // Characters of plain UTF-8 (see plainUtf8).
    bool addPlain(const unsigned char* p, size_t n) {
        size_t i = 0;
        while (i < n) {
            uint32_t c;
            i += plainCharacter(p + i, &c);
            if (!add(c)) return false;
        }
        return true;
    }
    const std::vector<unsigned char>& get() const { return bytes; }

private:
    bool caseSensitive;
    uint32_t lowerAscii[0x80];
    std::vector<unsigned char> bytes;
};

// 8 bytes of a key from byte `depth` on, most significant first, zeros past
// its end.  Keys hold no zero byte, so a key that ends sorts before every
// longer one that shares its bytes.
inline uint64_t loadBig64(const unsigned char* p) {
    return codec::decodeBig64(reinterpret_cast<const char*>(p));
}

uint64_t keyChunk(const KeyText& key, size_t depth) {
    size_t head = key.headLength;
    if (depth + 8 <= head) return loadBig64(key.head + depth);
    size_t tailStart = head + (key.separator ? 1 : 0);
    if (depth >= tailStart && depth - tailStart + 8 <= key.tailLength) {
        return loadBig64(key.tail + (depth - tailStart));
    }
    // Across the end of a piece or of the key: gather the pieces.
    unsigned char bytes[8] = {0, 0, 0, 0, 0, 0, 0, 0};
    size_t filled = 0;
    if (depth < head) {
        filled = head - depth < 8 ? head - depth : 8;
        std::memcpy(bytes, key.head + depth, filled);
    }
    if (filled < 8 && key.separator && depth + filled == head) {
        bytes[filled++] = static_cast<unsigned char>(utils::PathSeparator);
    }
    size_t at = depth + filled;  // position in the key of bytes[filled]
    if (filled < 8 && at >= tailStart && at - tailStart < key.tailLength) {
        size_t available = key.tailLength - (at - tailStart);
        size_t take = 8 - filled < available ? 8 - filled : available;
        std::memcpy(bytes + filled, key.tail + (at - tailStart), take);
    }
    return loadBig64(bytes);
}

// Numbers the keys: equal keys get equal numbers, and numbers rise with the
// keys.  A most-significant-first sort, 8 bytes a round: each round reads
// the next 8 bytes of every key of a group that agrees so far, sorts the
// group by them and splits it.
//
// Neighbouring keys with the same head (the hits of one directory, for the
// full path; equal keys, for the path) go as one unit while the round is
// inside their common head, and are read once for all of them; a unit
// breaks up into its keys where the head ends.  The sort moves small entries
// that carry where their bytes lie, so that a round visits each key's bytes
// and nothing else.
class KeyNumbering {
public:
    KeyNumbering(const std::vector<KeyText>& keys, std::vector<uint32_t>& numbers)
        : keys(keys), numbers(numbers), next(0) {}

    void run() {
        numbers.assign(keys.size(), 0);
        std::vector<Entry> entries;
        for (size_t i = 0; i < keys.size();) {
            size_t j = i + 1;
            while (j < keys.size() && sameHead(keys[i], keys[j])) ++j;
            entries.push_back(entryFor(i, j - i));
            i = j;
        }
        if (!entries.empty()) group(entries.data(), entries.data() + entries.size(), 0);
    }

private:
    struct Entry {
        uint64_t chunk;  // 8 bytes of its keys at the current depth
        const unsigned char* head;
        const unsigned char* tail;
        uint32_t headLength;
        uint32_t tailLength;
        uint32_t first;  // its keys are keys[first .. first + count)
        uint32_t count;
        bool separator;
        bool equal;  // its keys are equal (they have no tail)
        KeyText text() const { return KeyText{head, tail, headLength, tailLength, separator}; }
        size_t length() const { return text().length(); }
    };

    static bool sameHead(const KeyText& x, const KeyText& y) {
        return x.headLength == y.headLength && x.separator == y.separator &&
               (x.head == y.head || std::memcmp(x.head, y.head, x.headLength) == 0);
    }

    Entry entryFor(size_t first, size_t count) const {
        const KeyText& k = keys[first];
        Entry e;
        e.chunk = 0;
        e.head = k.head;
        e.tail = k.tail;
        e.headLength = k.headLength;
        e.tailLength = k.tailLength;
        e.first = static_cast<uint32_t>(first);
        e.count = static_cast<uint32_t>(count);
        e.separator = k.separator;
        e.equal = count == 1 || k.tail == nullptr;
        return e;
    }

    void number(const Entry* begin, const Entry* end) {
        for (const Entry* e = begin; e != end; ++e) {
            for (uint32_t k = 0; k < e->count; ++k) numbers[e->first + k] = next;
        }
        ++next;
    }

    // Large groups are sorted as small (chunk, position) pairs and then put
    // in that order: moving the pairs costs a third of moving the entries.
    void sortByChunk(Entry* begin, Entry* end) {
        const ptrdiff_t kLarge = 64;
        ptrdiff_t n = end - begin;
        if (n <= kLarge) {
            std::sort(begin, end, [](const Entry& x, const Entry& y) { return x.chunk < y.chunk; });
            return;
        }
        std::vector<std::pair<uint64_t, uint32_t>> order(static_cast<size_t>(n));
        for (ptrdiff_t k = 0; k < n; ++k) order[k] = std::make_pair(begin[k].chunk, static_cast<uint32_t>(k));
        std::sort(order.begin(), order.end(),
                  [](const std::pair<uint64_t, uint32_t>& x, const std::pair<uint64_t, uint32_t>& y) {
                      return x.first < y.first;
                  });
        std::vector<Entry> sorted(static_cast<size_t>(n));
        for (ptrdiff_t k = 0; k < n; ++k) sorted[k] = begin[order[k].second];
        std::copy(sorted.begin(), sorted.end(), begin);
    }

    // Keys in [begin, end) agree on their first `depth` bytes.
    void group(Entry* begin, Entry* end, size_t depth) {
        const ptrdiff_t kAhead = 8;
        for (;;) {
            // Units whose common head ends inside the next 8 bytes break up.
            bool breakUp = false;
            for (Entry* e = begin; e != end && !breakUp; ++e) {
                breakUp = !e->equal && e->text().shared() < depth + 8;
            }
            if (breakUp) {
                size_t count = 0;
                for (Entry* e = begin; e != end; ++e) {
                    count += !e->equal && e->text().shared() < depth + 8 ? e->count : 1;
                }
                std::vector<Entry> parts;
                parts.reserve(count);
                for (Entry* e = begin; e != end; ++e) {
                    if (!e->equal && e->text().shared() < depth + 8) {
                        for (uint32_t k = 0; k < e->count; ++k) parts.push_back(entryFor(e->first + k, 1));
                    } else {
                        parts.push_back(*e);
                    }
                }
                group(parts.data(), parts.data() + parts.size(), depth);
                return;
            }
            if (end - begin == 1) {
                if (begin->equal) {
                    number(begin, end);
                    return;
                }
                // One unit: its keys agree up to the end of their head.
                depth = begin->text().shared();
                continue;
            }
            uint64_t lowest = ~0ull;
            uint64_t highest = 0;
            size_t longest = 0;
            bool anyOpen = false;
            for (Entry* e = begin; e != end; ++e) {
                if (end - e > kAhead) __builtin_prefetch(e[kAhead].head + depth);
                e->chunk = keyChunk(e->text(), depth);
                if (e->chunk < lowest) lowest = e->chunk;
                if (e->chunk > highest) highest = e->chunk;
                size_t length = e->length();
                if (length > longest) longest = length;
                if (!e->equal) anyOpen = true;
            }
            if (lowest == highest) {
                // One group again: equal keys when none goes on, else the
                // next 8 bytes decide.
                if (!anyOpen && longest <= depth + 8) {
                    number(begin, end);
                    return;
                }
                depth += 8;
                continue;
            }
            sortByChunk(begin, end);
            for (Entry* first = begin; first != end;) {
                Entry* last = first + 1;
                size_t groupLongest = first->length();
                bool groupOpen = !first->equal;
                while (last != end && last->chunk == first->chunk) {
                    size_t length = last->length();
                    if (length > groupLongest) groupLongest = length;
                    if (!last->equal) groupOpen = true;
                    ++last;
                }
                // Keys that share 8 bytes and all end inside them are equal:
                // a shorter one would show a zero where the other has a byte.
                if (!groupOpen && (last - first == 1 || groupLongest <= depth + 8)) {
                    number(first, last);
                } else {
                    group(first, last, depth + 8);
                }
                first = last;
            }
            return;
        }
    }

    const std::vector<KeyText>& keys;
    std::vector<uint32_t>& numbers;
    uint32_t next;
};

// The key texts of the records of one file, for one key and case rule.
class KeyCollector {
public:
    KeyCollector(unsigned int key, bool caseSensitive)
        : key(key),
          caseSensitive(caseSensitive),
          lowersSeparatorToItself(std::towlower(static_cast<wint_t>(utils::PathSeparator)) ==
                                  static_cast<wint_t>(utils::PathSeparator)),
          builder(caseSensitive),
          lastRaw(nullptr),
          lastRawLength(0),
          lastLowered(nullptr),
          lastLoweredLength(0) {}

    // The key of a plain record; false for a character without an order-
    // keeping form.  *missing when the key's text is missing.
    bool addPlain(const unsigned char* file, const StoredRecord& record, uint32_t* slot, bool* missing) {
        bool byName = key == FsFileInfo::COMPARE_NAME;
        bool joined = key == FsFileInfo::COMPARE_FULL_PATH;
        *missing = (byName ? record.nameState : record.pathState) == kTextMissing ||
                   (joined && record.nameState == kTextMissing);
        if (*missing) return true;
        const unsigned char* head = file + (byName ? record.nameOffset() : record.pathOffset());
        uint32_t headLength = byName ? record.nameLength : record.pathLength;
        const unsigned char* name = file + record.nameOffset();
        KeyText text;
        text.separator = joined && headLength > 0 &&
                         head[headLength - 1] != static_cast<unsigned char>(utils::PathSeparator);
        if (caseSensitive) {
            // Plain UTF-8 is its own key: the bytes stay in the file.
            text.head = head;
            text.headLength = headLength;
        } else if (lowersSeparatorToItself || !joined) {
            // Lowered head and name apart, so that the hits of one directory
            // share one lowered head (and count as one unit when numbered).
            if (!lowered(head, headLength, text)) return false;
        } else {
            builder.clear();
            if (!builder.addPlain(head, headLength)) return false;
            uint32_t separator = static_cast<uint32_t>(utils::PathSeparator);
            if (text.separator && !builder.add(separator)) return false;
            if (!builder.addPlain(name, record.nameLength)) return false;
            store(builder.get(), text);
            *slot = push(text);
            return true;
        }
        text.tail = nullptr;
        text.tailLength = 0;
        if (joined) {
            if (caseSensitive) {
                text.tail = name;
                text.tailLength = record.nameLength;
            } else {
                builder.clear();
                if (!builder.addPlain(name, record.nameLength)) return false;
                KeyText lowerName;
                store(builder.get(), lowerName);
                text.tail = lowerName.head;
                text.tailLength = lowerName.headLength;
            }
        }
        *slot = push(text);
        return true;
    }

    // The key of a record as FsFileInfo holds it.
    bool addLoaded(const FsFileInfo& info, uint32_t* slot, bool* missing) {
        const wchar_t* path = info.getPath();
        const wchar_t* name = info.getName();
        wchar_t* joined = nullptr;
        const wchar_t* text = nullptr;
        switch (key) {
            case FsFileInfo::COMPARE_PATH: text = path; break;
            case FsFileInfo::COMPARE_NAME: text = name; break;
            default:
                joined = getPathName(path, name);
                text = joined;
                break;
        }
        *missing = text == nullptr;
        if (*missing) return true;
        builder.clear();
        bool ok = builder.addWide(text);
        delete[] joined;
        if (!ok) return false;
        KeyText stored;
        store(builder.get(), stored);
        *slot = push(stored);
        return true;
    }

    const std::vector<KeyText>& texts() const { return keys; }
    void reserve(size_t count) { keys.reserve(count); }

private:
    // The lowered form of plain bytes as text's head; the previous record's
    // when it has the same bytes (the hits of one directory follow each other).
    bool lowered(const unsigned char* raw, uint32_t length, KeyText& text) {
        if (lastLowered == nullptr || length != lastRawLength || std::memcmp(raw, lastRaw, length) != 0) {
            builder.clear();
            if (!builder.addPlain(raw, length)) return false;
            KeyText stored;
            store(builder.get(), stored);
            lastRaw = raw;
            lastRawLength = length;
            lastLowered = stored.head;
            lastLoweredLength = stored.headLength;
        }
        text.head = lastLowered;
        text.headLength = lastLoweredLength;
        return true;
    }

    void store(const std::vector<unsigned char>& bytes, KeyText& text) {
        unsigned char* copy = arena.allocate(bytes.size() + 1);
        if (!bytes.empty()) std::memcpy(copy, bytes.data(), bytes.size());
        text.head = copy;
        text.headLength = static_cast<uint32_t>(bytes.size());
        text.tail = nullptr;
        text.tailLength = 0;
        text.separator = false;
    }
    uint32_t push(const KeyText& text) {
        keys.push_back(text);
        return static_cast<uint32_t>(keys.size() - 1);
    }

    unsigned int key;
    bool caseSensitive;
    // towlower leaves the separator alone (so the lowered full path is the
    // lowered path, the separator and the lowered name).
    bool lowersSeparatorToItself;
    KeyBuilder builder;
    KeyArena arena;
    std::vector<KeyText> keys;
    const unsigned char* lastRaw;
    uint32_t lastRawLength;
    const unsigned char* lastLowered;
    uint32_t lastLoweredLength;
};

// A result file's bytes in memory: mapped read-only, or read when it cannot
// be mapped.  The sort reads the file once and writes a new one in its place,
// so a mapping keeps the bytes as long as the sort needs them.
class FileImage {
public:
    FileImage() : mapped(nullptr), length(0) {}
    ~FileImage() {
        if (mapped != nullptr) fscanner::Env::Current()->unmapFile(mapped, length);
    }
    // False for a file that cannot be read or is larger than limit.
    bool load(const char* name, uint32_t limit) {
        fscanner::Env* env = fscanner::Env::Current();
        int fd = env->openFile(name, O_RDONLY | O_CLOEXEC);
        if (fd < 0) return false;
        struct stat st;
        bool ok = env->fileStatus(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_size >= 0 &&
                  static_cast<unsigned long long>(st.st_size) <= limit;
        if (ok && st.st_size > 0) {
            length = static_cast<size_t>(st.st_size);
            void* p = env->mapFile(nullptr, length, PROT_READ, MAP_PRIVATE | MAP_POPULATE, fd, 0);
            if (p != MAP_FAILED) {
                mapped = static_cast<unsigned char*>(p);
            } else {
                ok = readAll(fd);
            }
        }
        env->closeFile(fd);
        return ok;
    }
    const unsigned char* data() const { return mapped != nullptr ? mapped : copy.data(); }
    size_t size() const { return length; }

private:
    FileImage(const FileImage&);
    FileImage& operator=(const FileImage&);

    bool readAll(int fd) {
        copy.resize(length);
        size_t done = 0;
        while (done < length) {
            ssize_t n = fscanner::Env::Current()->readFile(fd, copy.data() + done, length - done);
            if (n < 0 && errno == EINTR) continue;
            if (n <= 0) return false;  // a file that changed under us goes to the passes
            done += static_cast<size_t>(n);
        }
        return true;
    }

    unsigned char* mapped;
    size_t length;
    std::vector<unsigned char> copy;
};

// A result file read whole: its bytes, where its records start up to the
// first one that cannot be read (and where that one starts), and for each
// record that is not plain the bytes the passes would write for it.
struct LoadedFile {
    static constexpr uint32_t kAsStored = ~0u;
    FileImage image;
    std::vector<uint32_t> starts;  // one more than there are records
    std::vector<std::string> rewritten;
    std::vector<uint32_t> rewrittenOf;  // index into rewritten, or kAsStored

    size_t records() const { return starts.size() - 1; }
    void bytesOf(uint32_t id, const unsigned char** data, size_t* length) const {
        if (rewrittenOf[id] != kAsStored) {
            const std::string& copy = rewritten[rewrittenOf[id]];
            *data = reinterpret_cast<const unsigned char*>(copy.data());
            *length = copy.size();
        } else {
            *data = image.data() + starts[id];
            *length = starts[id + 1] - starts[id];
        }
    }
};

bool writeAll(int fd, const unsigned char* data, size_t length) {
    return fscanner::WriteFully(fscanner::Env::Current(), fd, data, length);
}

// Writes the records in `order` to `scratch` through `buffer` (whose
// capacity is reserved: nothing is allocated here), then puts the scratch
// file in the file's place.  False, with the file as it was and no scratch
// file left, on any failure.
bool writeInOrder(const char* name, const char* scratch, const LoadedFile& loaded,
                  const std::vector<uint32_t>& order, std::vector<unsigned char>& buffer) {
    fscanner::Env* env = fscanner::Env::Current();
    env->removeFile(scratch);
    int fd = env->openFile(scratch, O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0660);
    if (fd < 0) return false;
    size_t capacity = buffer.capacity();
    buffer.clear();
    bool ok = true;
    for (uint32_t id : order) {
        const unsigned char* data;
        size_t length;
        loaded.bytesOf(id, &data, &length);
        if (buffer.size() + length > capacity) {
            ok = writeAll(fd, buffer.data(), buffer.size());
            buffer.clear();
            if (!ok) break;
        }
        if (length > capacity) {
            ok = writeAll(fd, data, length);
            if (!ok) break;
        } else {
            buffer.insert(buffer.end(), data, data + length);
        }
    }
    if (ok) ok = writeAll(fd, buffer.data(), buffer.size());
    buffer.clear();
    if (env->closeFile(fd) != 0) ok = false;
    if (ok && env->renameFile(scratch, name) != 0) ok = false;
    if (!ok) env->removeFile(scratch);
    return ok;
}

// Reads the file, gives every record its replay entry and numbers the keys.
// False for a key character without an order-keeping form.  The replay
// entries' key fields hold key slots until the numbers replace them.
bool loadForReplay(LoadedFile& loaded, unsigned int key, bool caseSensitive,
                   std::vector<NaturalMergeReplay::Record>& replay) {
    const unsigned char* file = loaded.image.data();
    size_t end = loaded.image.size();
    bool bySize = key == FsFileInfo::COMPARE_SIZE;
    const uint64_t kNoKey = NaturalMergeReplay::MISSING_KEY;
    KeyCollector keys(key, caseSensitive);
    // Records are rarely below 64 bytes (four counts, a mask, a size, and
    // the path); the estimate only saves regrowing.
    size_t estimate = end / 64 + 1;
    loaded.starts.reserve(estimate + 1);
    replay.reserve(estimate);
    if (!bySize) keys.reserve(estimate);
    ReloadedRecord reloaded;
    size_t at = 0;
    for (;;) {
        StoredRecord record;
        if (at >= end || !parseStoredRecord(file, end, at, record)) break;
        uint32_t id = static_cast<uint32_t>(replay.size());
        loaded.starts.push_back(static_cast<uint32_t>(at));
        at += record.length;
        NaturalMergeReplay::Record item;
        item.id = id;
        item.keyInFile = item.keyWritten = record.size;
        uint32_t slot = 0;
        bool missing = false;
        if (record.plain) {
            item.written = record.complete;
            if (!bySize) {
                if (!keys.addPlain(file, record, &slot, &missing)) return false;
                item.keyInFile = item.keyWritten = missing ? kNoKey : slot;
            }
            replay.push_back(item);
            continue;
        }
        reloadRecord(file + record.offset, record.length, reloaded);
        item.written = reloaded.kept;
        if (reloaded.kept) {
            loaded.rewrittenOf.resize(id + 1, LoadedFile::kAsStored);
            loaded.rewrittenOf[id] = static_cast<uint32_t>(loaded.rewritten.size());
            loaded.rewritten.push_back(reloaded.written);
        }
        if (!bySize) {
            if (!keys.addLoaded(reloaded.asRead, &slot, &missing)) return false;
            item.keyInFile = missing ? kNoKey : slot;
            item.keyWritten = kNoKey;
            if (reloaded.kept) {
                if (!keys.addLoaded(reloaded.asWritten, &slot, &missing)) return false;
                item.keyWritten = missing ? kNoKey : slot;
            }
        }
        replay.push_back(item);
    }
    loaded.starts.push_back(static_cast<uint32_t>(at));
    loaded.rewrittenOf.resize(replay.size(), LoadedFile::kAsStored);
    if (!bySize) {
        std::vector<uint32_t> numbers;
        KeyNumbering(keys.texts(), numbers).run();
        for (NaturalMergeReplay::Record& item : replay) {
            if (item.keyInFile != kNoKey) item.keyInFile = numbers[item.keyInFile];
            if (item.keyWritten != kNoKey) item.keyWritten = numbers[item.keyWritten];
        }
    }
    return true;
}

// resultsort::sortInMemory (see the header).
bool sortFileInMemory(const char* name, const wchar_t* wideName, unsigned int key, unsigned int order,
                  bool caseSensitive) {
    if (order != NaturalMergeSort::ORDER_ASCENDING && order != NaturalMergeSort::ORDER_DESCENDING) {
        return false;
    }
    LoadedFile loaded;
    std::vector<uint32_t> sorted;
    std::vector<unsigned char> buffer;
    std::string scratch;
    try {
        if (!loaded.image.load(name, NaturalMergeReplay::limitBytes())) return false;
        std::vector<NaturalMergeReplay::Record> replay;
        if (!loadForReplay(loaded, key, caseSensitive, replay)) return false;
        // The passes' first scratch name: a sort cut short leaves nothing
        // that those who clean up after a sort do not know.
        scratch = std::string(name) + NATURAL_MERGE_SCRATCH_A;
        buffer.reserve(kWriteBuffer);
        NaturalMergeReplay::sort(wideName, order, key != FsFileInfo::COMPARE_SIZE, replay, sorted);
    } catch (const std::bad_alloc&) {
        return false;
    }
    // The replay has traced: the sort is ours to finish, without allocating.
    if (!writeInOrder(name, scratch.c_str(), loaded, sorted, buffer)) {
        getQvLogFs()->traceMIN(__LINE__, __FILE__, __func__,
                               "NaturalMergeSort::sort - cannot write the sorted records of [%S]; the "
                               "file stays as it was\n",
                               wideName);
    }
    return true;
}

// ---- the passes on disk --------------------------------------------------------
//
// A file above the replay's limit (or with a key character that has no
// order-keeping form) goes through NaturalMergeSort's passes.  Their
// callbacks see a record as its bytes and its key, not as an FsFileInfo: a
// read takes the record's bytes as loadObject would (failing where it fails),
// keeps them as the bytes the write gives back (for a plain record; for any
// other, what saveObject makes of what loadObject made of them, or nothing
// when saveObject refuses it), and decodes only the key, once, into the form
// FsFileInfo::compare compares (the joined path for the full path).  The
// comparison is compare's own, on that form.

// A record between the callbacks: one block with the key text and the bytes
// behind it.
struct PassRecord {
    uint64_t size;
    const wchar_t* key;     // null when the key's text is missing
    const unsigned char* bytes;
    uint32_t length;        // bytes to write
    bool written;           // false: saveObject would refuse the record
};

// A load that fails before the end of the file met damaged bytes and stopped
// somewhere inside them.  The sort must not go on reading from there: it
// would take the middle of a string for a new record and put records into the
// sorted file that a reader never saw.  So damage ends the input, as it ends
// a reader's walk: the file is moved to its end.  At the real end this is no
// move at all, so valid files sort as before.
void endInputAtDamage(AbstractFile* file) {
    file->seek(0, SEEK_FROM_END);
}

// Appends `length` bytes of the file to raw; false on a short read.  A
// length beyond what the file holds fails before anything is allocated, as
// the serialiser's check of a long string does.
bool takeBytes(AbstractFile* file, uint32_t length, std::string& raw) {
    if (length == 0) return true;
    long position = file->tell();
    if (length >= resultfile::kInlineStringCount && position >= 0 && file->seek(0, SEEK_FROM_END)) {
        long end = file->tell();
        file->seek(position, SEEK_FROM_START);
        if (end < position || static_cast<unsigned long>(end - position) < length) return false;
    }
    size_t at = raw.size();
    raw.resize(at + length);
    return file->read(&raw[at], length) == length;
}

// Reads the bytes of the record at the file's position into raw, as
// loadObject reads them; false where loadObject would fail.
bool readRecordBytes(AbstractFile* file, std::string& raw) {
    raw.clear();
    char word[resultfile::kUnsigned32Size];
    for (int text = 0; text < 4; ++text) {
        if (file->read(word, sizeof word) != sizeof word) return false;
        raw.append(word, sizeof word);
        uint32_t count = codec::decodeBig32(word);
        if (count > 1 && !takeBytes(file, count - 1, raw)) return false;
    }
    if (file->read(word, sizeof word) != sizeof word) return false;
    raw.append(word, sizeof word);
    uint32_t present = codec::decodeBig32(word) & 0xFFF;
    uint32_t fields = 0;
    for (uint32_t rest = present; rest != 0; rest &= rest - 1) fields += resultfile::kUnsigned32Size;
    if (present & FsFileInfo::VALID_SIZE) fields += resultfile::kUnsigned64Size - resultfile::kUnsigned32Size;
    size_t at = raw.size();
    raw.resize(at + fields);
    return fields == 0 || file->read(&raw[at], fields) == fields;
}

// The key text of a record as FsFileInfo holds it, for compare: the path,
// the name, or the two joined as getPathName joins them.
wchar_t* keyOf(unsigned int key, const wchar_t* path, const wchar_t* name) {
    const wchar_t* text = key == FsFileInfo::COMPARE_NAME ? name : path;
    if (key == FsFileInfo::COMPARE_FULL_PATH) return getPathName(path, name);
    if (text == nullptr) return nullptr;
    size_t length = std::wcslen(text);
    wchar_t* copy = new (std::nothrow) wchar_t[length + 1];
    if (copy != nullptr) std::wmemcpy(copy, text, length + 1);
    return copy;
}

// Characters of plain UTF-8: its bytes that are not continuation bytes.
size_t plainCharacters(const unsigned char* p, uint32_t length) {
    size_t count = 0;
    for (uint32_t i = 0; i < length; ++i) count += (p[i] & 0xC0) != 0x80;
    return count;
}

// Plain UTF-8 decoded as loadString decodes it (plain UTF-8 leaves the
// lenient decoder no choice), without a terminator; gives the end.
wchar_t* decodePlain(const unsigned char* p, uint32_t length, wchar_t* out) {
    for (uint32_t i = 0; i < length;) {
        uint32_t c;
        i += static_cast<uint32_t>(plainCharacter(p + i, &c));
        *out++ = static_cast<wchar_t>(c);
    }
    return out;
}

// Allocates the record's block for a key of keyLength characters (with its
// terminator; 0 for none) and `length` bytes; null when memory runs out.
PassRecord* allocatePassRecord(size_t keyLength, size_t length) {
    unsigned char* block = static_cast<unsigned char*>(
        std::malloc(sizeof(PassRecord) + keyLength * sizeof(wchar_t) + length));
    if (block == nullptr) return nullptr;
    PassRecord* record = reinterpret_cast<PassRecord*>(block);
    record->key = keyLength != 0 ? reinterpret_cast<wchar_t*>(block + sizeof(PassRecord)) : nullptr;
    record->bytes = block + sizeof(PassRecord) + keyLength * sizeof(wchar_t);
    record->length = static_cast<uint32_t>(length);
    return record;
}

// Makes the record from its bytes; null when memory runs out.  A plain
// record takes one allocation: its key is decoded straight into the block.
PassRecord* makePassRecord(unsigned int key, const std::string& raw) {
    const unsigned char* bytes = reinterpret_cast<const unsigned char*>(raw.data());
    StoredRecord stored;
    if (!parseStoredRecord(bytes, raw.size(), 0, stored)) return nullptr;
    bool byText = key != FsFileInfo::COMPARE_SIZE;
    if (stored.plain) {
        const unsigned char* path = bytes + stored.pathOffset();
        const unsigned char* name = bytes + stored.nameOffset();
        bool byName = key == FsFileInfo::COMPARE_NAME;
        bool joined = key == FsFileInfo::COMPARE_FULL_PATH;
        bool missing = !byText || (byName ? stored.nameState : stored.pathState) == kTextMissing ||
                       (joined && stored.nameState == kTextMissing);
        // getPathName's separator: a path that is not empty and does not
        // end with one gets one.
        bool separator = joined && stored.pathLength > 0 &&
                         path[stored.pathLength - 1] != static_cast<unsigned char>(utils::PathSeparator);
        size_t keyLength = 0;
        if (!missing) {
            keyLength = (byName ? 0 : plainCharacters(path, stored.pathLength)) +
                        (byName || joined ? plainCharacters(name, stored.nameLength) : 0) +
                        (separator ? 1 : 0) + 1;
        }
        size_t length = stored.complete ? raw.size() : 0;
        PassRecord* record = allocatePassRecord(keyLength, length);
        if (record == nullptr) return nullptr;
        if (!missing) {
            wchar_t* out = const_cast<wchar_t*>(record->key);
            if (!byName) out = decodePlain(path, stored.pathLength, out);
            if (separator) *out++ = utils::PathSeparator;
            if (byName || joined) out = decodePlain(name, stored.nameLength, out);
            *out = 0;
        }
        if (length != 0) std::memcpy(const_cast<unsigned char*>(record->bytes), bytes, length);
        record->size = stored.size;
        record->written = stored.complete;
        return record;
    }
    // Anything else goes through the loader and the writer, as on disk.
    ReloadedRecord reloaded;
    reloadRecord(bytes, raw.size(), reloaded);
    wchar_t* text = nullptr;
    if (byText) {
        const wchar_t* path = reloaded.asRead.getPath();
        const wchar_t* name = reloaded.asRead.getName();
        bool missing = (key == FsFileInfo::COMPARE_NAME ? name : path) == nullptr ||
                       (key == FsFileInfo::COMPARE_FULL_PATH && name == nullptr);
        if (!missing) {
            text = keyOf(key, path, name);
            if (text == nullptr) return nullptr;
        }
    }
    size_t keyLength = text != nullptr ? std::wcslen(text) + 1 : 0;
    size_t length = reloaded.kept ? reloaded.written.size() : 0;
    PassRecord* record = allocatePassRecord(keyLength, length);
    if (record != nullptr) {
        if (text != nullptr) std::wmemcpy(const_cast<wchar_t*>(record->key), text, keyLength);
        if (length != 0) {
            std::memcpy(const_cast<unsigned char*>(record->bytes), reloaded.written.data(), length);
        }
        record->size = stored.size;
        record->written = reloaded.kept;
    }
    delete[] text;
    return record;
}

// The bytes of the record being read, kept from one read to the next so that
// a read allocates nothing for them.  One per thread: sorts of different
// result sets may run in different threads.
std::string& passBuffer() {
    thread_local std::string buffer;
    return buffer;
}

template <unsigned int Key>
int readPassRecord(AbstractFile* file, void** record) {
    if (record == nullptr) return 0;
    *record = nullptr;
    if (file == nullptr) return 0;
    std::string& raw = passBuffer();
    if (!readRecordBytes(file, raw)) {
        endInputAtDamage(file);
        return 0;
    }
    *record = makePassRecord(Key, raw);
    return *record != nullptr ? 1 : 0;
}

// A successful read leaves the file's end flag clear for the peek to count;
// with a LinuxMmFile that holds whenever the record's bytes were there.
template <unsigned int Key>
bool peekPassRecord(AbstractFile* file, void** record) {
    if (record == nullptr) return false;
    *record = nullptr;
    if (file == nullptr) return false;
    long position = file->tell();
    std::string& raw = passBuffer();
    if (readRecordBytes(file, raw) && !file->eof()) {
        file->seek(position, SEEK_FROM_START);
        *record = makePassRecord(Key, raw);
        return *record != nullptr;
    }
    endInputAtDamage(file);
    return false;
}

int writePassRecord(AbstractFile* file, void* record) {
    if (file == nullptr || record == nullptr) return 0;
    PassRecord* r = static_cast<PassRecord*>(record);
    if (!r->written) return 0;
    return file->write(const_cast<unsigned char*>(r->bytes), r->length) == r->length ? 1 : 0;
}

void freePassRecord(void* record) {
    std::free(record);
}

template <unsigned int Key>
bool comparePassRecords(void* a, void* b, unsigned int op, bool flag) {
    if (a == nullptr || b == nullptr) return false;
    const PassRecord* x = static_cast<const PassRecord*>(a);
    const PassRecord* y = static_cast<const PassRecord*>(b);
    if (Key == FsFileInfo::COMPARE_SIZE) return checkSimpleExpression(x->size, op, y->size);
    return checkSimpleExpression(x->key, op, y->key, flag);
}

// The record callbacks of the merge passes for one sort key.
template <unsigned int Key>
bool keyCallbacks(resultsort::PassCallbacks& callbacks) {
    callbacks.compare = comparePassRecords<Key>;
    callbacks.read = readPassRecord<Key>;
    callbacks.peek = peekPassRecord<Key>;
    return true;
}

}  // namespace

namespace resultsort {

bool sortInMemory(const char* name, const wchar_t* wideName, unsigned int key, unsigned int order,
                  bool caseSensitive) {
    return sortFileInMemory(name, wideName, key, order, caseSensitive);
}

bool passCallbacks(unsigned int key, PassCallbacks& callbacks) {
    callbacks.write = writePassRecord;
    callbacks.free = freePassRecord;
    switch (key) {
        case FsFileInfo::COMPARE_PATH:
            return keyCallbacks<FsFileInfo::COMPARE_PATH>(callbacks);
        case FsFileInfo::COMPARE_NAME:
            return keyCallbacks<FsFileInfo::COMPARE_NAME>(callbacks);
        case FsFileInfo::COMPARE_FULL_PATH:
            return keyCallbacks<FsFileInfo::COMPARE_FULL_PATH>(callbacks);
        case FsFileInfo::COMPARE_SIZE:
            return keyCallbacks<FsFileInfo::COMPARE_SIZE>(callbacks);
        default:
            return false;
    }
}

}  // namespace resultsort
