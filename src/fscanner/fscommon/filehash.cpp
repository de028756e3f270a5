#include "fscanner/fscommon/filehash.h"

#include <cstdlib>
#include <cstring>
#include <ctime>

#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/wildcard.h"

// --- FileHashBlackBox -----------------------------------------------------------

FileHashBlackBox::FileHashBlackBox() : count(0) {}

void FileHashBlackBox::insert_crc32(unsigned int value) {
    crc32Values.push_back(value);
    ++count;
}

void FileHashBlackBox::insert_q32(unsigned int value) {
    q32Values.push_back(value);
    ++count;
}

void FileHashBlackBox::insert_md5(u_int128 value) {
    md5Values.push_back(value);
    ++count;
}

void FileHashBlackBox::insert_sha256(u_int256 value) {
    sha256Values.push_back(value);
    ++count;
}

bool FileHashBlackBox::empty() const { return count == 0; }

unsigned int FileHashBlackBox::size() const { return count; }

bool FileHashBlackBox::find(FileChecksumInfo const& info) const {
    const uint32_t flags = info.flags;
    if (flags == 0) return false;
    if (flags & FILE_CHECKSUM_CRC32) {
        for (unsigned int value : crc32Values)
            if (value == info.crc32) return true;
    }
    if (flags & FILE_CHECKSUM_Q32) {
        for (unsigned int value : q32Values)
            if (value == info.q32) return true;
    }
    if (flags & FILE_CHECKSUM_MD5) {
        // The MD5 pass always runs over every value.
        bool found = false;
        for (u_int128 const& value : md5Values)
            if (std::memcmp(value.bytes, info.md5.bytes, sizeof value.bytes) == 0) found = true;
        if (found) return true;
    }
    // SHA-256 values are kept and counted, never compared.
    return false;
}

// --- StaticHashTable ----------------------------------------------------------------

namespace {

// 256 fixed pseudo-random words.  Slots never reach the disk, so any fixed
// table serves; this one is made by a 32-bit mixing function at compile time.
struct ScatterTable {
    unsigned int values[256];
    constexpr ScatterTable() : values() {
        unsigned int x = 0x9E3779B9u;
        for (int i = 0; i < 256; ++i) {
            x += 0x9E3779B9u;
            unsigned int z = x;
            z = (z ^ (z >> 16)) * 0x85EBCA6Bu;
            z = (z ^ (z >> 13)) * 0xC2B2AE35u;
            z = z ^ (z >> 16);
            values[i] = z;
        }
    }
};

constexpr ScatterTable kScatter;

}  // namespace

StaticHashTable::StaticHashTable(std::vector<wchar_t*> const& list, bool caseSensitiveFlag)
    : slots(nullptr),
      mask(0),
      seed(0),
      size(16),
      count(0),
      caseSensitive(caseSensitiveFlag),
      strings(list) {
    std::srand(static_cast<unsigned int>(std::time(nullptr)));
    seed = std::rand();
    const long long n = static_cast<long long>(strings.size());
    while (static_cast<long long>(size) <= 3 * n) size *= 2;
    mask = size - 1;
    slots = new int[size];
    for (int i = 0; i < size; ++i) slots[i] = -1;
    for (int i = 0; i < static_cast<int>(strings.size()); ++i) hash_insert(i);
}

StaticHashTable::~StaticHashTable() { delete[] slots; }

unsigned int StaticHashTable::hash_scatter(wchar_t const* text) {
    unsigned int h = 0;
    if (text == nullptr) return h;
    for (; *text != 0; ++text) h = h * 2u + kScatter.values[static_cast<unsigned int>(*text) & 255u];
    return h;
}

void StaticHashTable::hash_insert(int i) {
    if (i < 0 || i >= static_cast<int>(strings.size()) || strings[i] == nullptr) return;
    const unsigned int h = hash_scatter(strings[i]);
    const unsigned int m = static_cast<unsigned int>(mask);
    unsigned int slot = h & m;
    if (slots[slot] != -1) {
        // Probe seed + h + 1, seed + h + 2, ... A table with no free slot
        // (only reachable by inserting by hand) refuses the string.
        unsigned int step = 1;
        for (;; ++step) {
            if (step > static_cast<unsigned int>(size)) return;
            slot = (static_cast<unsigned int>(seed) + h + step) & m;
            if (slots[slot] == -1) break;
        }
    }
    slots[slot] = i;
    ++count;
}

int StaticHashTable::hash_index(wchar_t const* text) const {
    if (text == nullptr) return -1;
    const unsigned int h = hash_scatter(text);
    const unsigned int m = static_cast<unsigned int>(mask);
    int index = slots[h & m];
    if (index != -1 && wcsvccmp(strings[index], text, caseSensitive) == 0) return index;
    // The probe runs from seed + h + 1 even when the home slot is free, as
    // insertion does; at most size probes, so a full table cannot loop.
    for (unsigned int step = 1; step <= static_cast<unsigned int>(size); ++step) {
        index = slots[(static_cast<unsigned int>(seed) + h + step) & m];
        if (index == -1) return -1;
        if (wcsvccmp(strings[index], text, caseSensitive) == 0) return index;
    }
    return -1;
}

bool StaticHashTable::hash_find(wchar_t const* text) const { return hash_index(text) != -1; }

// --- FileMaskLookup -------------------------------------------------------------

FileMaskLookup::FileMaskLookup()
    : present(0),
      caseSensitive(false),
      committed(false),
      matchesAll(false),
      lengths(new unsigned char[LENGTH_SLOTS]()),
      plainTable(nullptr),
      leftTable(nullptr),
      rightTable(nullptr),
      inserted(0),
      currentLength(0) {}

// The copied masks and the hash tables are left allocated on purpose: an
// object lives as long as the expression that built it.
FileMaskLookup::~FileMaskLookup() { delete[] lengths; }

int FileMaskLookup::insert(wchar_t const* mask) {
    if (matchesAll) return 0;
    ++inserted;
    if (mask == nullptr) {
        getQvLogFs()->traceMAX(__LINE__, __FILE__, "insert",
                               "FileMaskLookup::insert - null mask refused\n");
        return 0;
    }
    int length = 0;
    int stars = 0;
    int questions = 0;
    for (wchar_t const* p = mask; *p != 0; ++p) {
        ++length;
        if (*p == L'*') ++stars;
        else if (*p == L'?') ++questions;
    }
    if (length == 0) return 0;

    const int wildcards = stars + questions;
    const bool leadingStar = wildcards == 1 && mask[0] == L'*';
    const bool trailingStar = wildcards == 1 && !leadingStar && mask[length - 1] == L'*';
    // The length block is indexed by the count of fixed characters.
    const int fixed = (leadingStar || trailingStar) ? length - 1 : length;
    if ((wildcards == 0 || leadingStar || trailingStar) && fixed >= LENGTH_SLOTS) {
        getQvLogFs()->traceMAX(__LINE__, __FILE__, "insert",
                               "FileMaskLookup::insert - mask of %d characters refused\n", length);
        return 0;
    }

    wchar_t* copy = new wchar_t[length + 1];
    std::wmemcpy(copy, mask, static_cast<size_t>(length) + 1);

    if (wildcards == 0) {
        lengths[length] |= SHAPE_PLAIN;
        present |= SHAPE_PLAIN;
        plainNames.push_back(copy);
        return SHAPE_PLAIN;
    }
    if (leadingStar) {
        if (length == 1) {
            matchesAll = true;
            delete[] copy;
            return 0;
        }
        lengths[length - 1] |= SHAPE_LEFT;
        present |= SHAPE_LEFT;
        leftTails.push_back(copy + 1);  // one character into the block
        return SHAPE_LEFT;
    }
    if (trailingStar) {
        lengths[length - 1] |= SHAPE_RIGHT;
        present |= SHAPE_RIGHT;
        copy[length - 1] = 0;
        rightHeads.push_back(copy);
        return SHAPE_RIGHT;
    }
    present |= SHAPE_HARD;
    hardMasks.push_back(copy);
    return SHAPE_HARD;
}

int FileMaskLookup::insert_stringlist(wchar_t const* list) {
    if (list == nullptr) return 0;
    const size_t scratchChars = 16384 / sizeof(wchar_t);
    wchar_t* scratch = new wchar_t[scratchChars];
    wchar_t const* p = list;
    for (;;) {
        p = std::wcschr(p, L'"');
        if (p == nullptr) break;
        ++p;
        wchar_t const* end = p;
        while (*end != 0 && *end != L'"') ++end;
        const size_t length = static_cast<size_t>(end - p);
        if (length < scratchChars) {
            std::wmemcpy(scratch, p, length);
            scratch[length] = 0;
            insert(scratch);
        } else {
            getQvLogFs()->traceMAX(__LINE__, __FILE__, "insert_stringlist",
                                   "FileMaskLookup::insert_stringlist - string of %lu characters "
                                   "skipped\n",
                                   static_cast<unsigned long>(length));
        }
        if (*end == 0) break;
        p = end + 1;  // over the closing quote
    }
    delete[] scratch;
    return 0;
}

void FileMaskLookup::commit_transaction(bool caseSensitiveFlag) {
    caseSensitive = caseSensitiveFlag;
    if (present & SHAPE_PLAIN) plainTable = new StaticHashTable(plainNames, caseSensitive);
    if (present & SHAPE_LEFT) leftTable = new StaticHashTable(leftTails, caseSensitive);
    if (present & SHAPE_RIGHT) rightTable = new StaticHashTable(rightHeads, caseSensitive);
    committed = true;
}

bool FileMaskLookup::find(wchar_t const* name) {
    if (!committed) return false;
    if (matchesAll) return true;
    if (name == nullptr) return false;
    const int length = static_cast<int>(std::wcslen(name));
    currentLength = length;

    if ((present & SHAPE_PLAIN) && plainTable != nullptr && length < LENGTH_SLOTS &&
        (lengths[length] & SHAPE_PLAIN) && plainTable->hash_find(name))
        return true;

    if ((present & SHAPE_LEFT) && leftTable != nullptr) {
        for (int k = 0; k < length; ++k) {
            const int n = length - k;
            if (n < LENGTH_SLOTS && (lengths[n] & SHAPE_LEFT) && leftTable->hash_find(name + k))
                return true;
        }
    }

    if ((present & SHAPE_RIGHT) && rightTable != nullptr) {
        // Heads are cut from a private copy of the name by an end mark that is
        // put and taken back at each length; the caller's text is not written,
        // so a name in read-only memory is safe.
        wchar_t head[LENGTH_SLOTS];
        const int limit = length < LENGTH_SLOTS ? length : LENGTH_SLOTS - 1;
        std::wmemcpy(head, name, static_cast<size_t>(limit));
        head[limit] = 0;
        for (int n = 1; n <= limit; ++n) {
            if (!(lengths[n] & SHAPE_RIGHT)) continue;
            const wchar_t saved = head[n];
            head[n] = 0;
            const bool hit = rightTable->hash_find(head);
            head[n] = saved;
            if (hit) return true;
        }
    }

    if (present & SHAPE_HARD) {
        for (wchar_t* mask : hardMasks)
            if (wildvccmp(mask, name, caseSensitive)) return true;
    }
    return false;
}

int FileMaskLookup::size() const { return inserted; }
