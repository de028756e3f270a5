// Opens a table made of arbitrary bytes and walks it: FS_Table::open, the
// moves, read of every live record, the hash-index lookups of each record's
// key and a chain walk from an arbitrary slot, then close; then, under the
// guard, a walk with a name filter row by row against the same walk passing
// over turned-away rows inside the table (they must agree); then erase.
//
// Input: 1 flag byte (bit 0 compressed integers, bits 1-6 overflow slots of
// the index file, bit 7 write an index file at all), the lengths of the data
// file, pointer file and index list as 16-bit little-endian words, a 32-bit
// chain slot, then the three files' bytes, then index patches of 12 bytes
// (slot, record number, next slot) applied to a file of empty buckets.
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cwchar>
#include <cwctype>
#include <string>

#include "fscanner/fscommon/criteria.h"
#include "fscanner/fscommon/fields.h"
#include "fscanner/fscommon/recordset.h"
#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/table.h"
#include "fuzz_support.h"

namespace {

const unsigned int kMaxChainSteps = 4096;
// More records than a table made from one input can have: its pointer file
// holds at most 16384 slots.
const unsigned int kMaxCursorRecords = 20000;

// FSCANNER_FUZZ_VERBOSE set: what was read goes to standard error, to check
// that a seed is a valid table.
bool verbose() {
    static const bool on = std::getenv("FSCANNER_FUZZ_VERBOSE") != nullptr;
    return on;
}

// The key under which the table files a record in an index on field.
std::wstring keyOf(Field* field) {
    wchar_t number[24];
    switch (field->getType()) {
        case FIELD_INT8: wcs_itoa(static_cast<Int8Field*>(field)->value(), number); return number;
        case FIELD_INT16: wcs_itoa(static_cast<Int16Field*>(field)->value(), number); return number;
        case FIELD_INT32: wcs_itoa(static_cast<Int32Field*>(field)->value(), number); return number;
        case FIELD_INT64:
            wcs_itoa(static_cast<unsigned int>(static_cast<Int64Field*>(field)->value()), number);
            return number;
        case FIELD_TEXT: {
            wchar_t const* text = static_cast<TextField*>(field)->value();
            std::wstring upper(text != nullptr ? text : L"");
            for (wchar_t& c : upper) c = static_cast<wchar_t>(towupper(static_cast<wint_t>(c)));
            return upper;
        }
        default: return L"";
    }
}

void walkChain(FS_Table& table, Index& index, unsigned int id, unsigned int next) {
    for (unsigned int steps = 0; steps < kMaxChainSteps; ++steps)
        if (!table.hashIndex_moveNext(index, id, next)) break;
}

// The same lookup through a cursor with criteria on the indexed column, as
// the cache makes it.  A chain visits each overflow slot at most once, so a
// cursor that yields more records than the index file can hold is caught
// going round a loop.
void cursorLookUp(FS_Table& table, wchar_t const* fieldName, unsigned int type, std::wstring const& key) {
    if (type < FIELD_INT8 || type > FIELD_TEXT) return;
    std::wstring criteria = L"[" + std::wstring(fieldName) + L"]==";
    if (type == FIELD_TEXT) {
        if (key.find(L'"') != std::wstring::npos) return;
        criteria += L"\"" + key + L"\"";
    } else {
        criteria += key;
    }
    CriteriaEvaluator evaluator(criteria.c_str());
    RecordSet cursor = table.openRecordSet();
    cursor.setCriteria(&evaluator, false);
    unsigned int yielded = 0;
    bool more = cursor.moveFirst();
    while (more) {
        if (++yielded > kMaxCursorRecords) std::abort();
        cursor.read();
        more = cursor.moveNext();
    }
    table.closeRecordSet(cursor);
}

void lookUp(FS_Table& table, Fields& record) {
    for (Index* index : table.getIndexes()) {
        if (index->getFieldName() == nullptr) continue;
        Field* field = record.name(index->getFieldName());
        if (field == nullptr) continue;
        std::wstring key = keyOf(field);
        unsigned int id = 0, next = 0;
        bool found = table.hashIndex_moveFirst(*index, key.c_str(), id, next);
        if (verbose()) std::fprintf(stderr, "  lookup '%ls': %d id %u next %u\n", key.c_str(), found ? 1 : 0, id, next);
        if (found) walkChain(table, *index, id, next);
        cursorLookUp(table, index->getFieldName(), field->getType(), key);
    }
}

// The filter of the walks below: names of an even byte count go.
bool evenLength(void*, const unsigned char*, uint32_t length) { return length % 2 == 0; }

// A cursor's walk with a name filter over the table as the files hold it,
// under the guard: each row decided on its peeked text of the first text
// column and read whole unless the filter turns it away; with skip, the rows
// the filter turns away are first passed over in the table (skipRejected),
// as the cursor does.  What it read and the damage noted, as text.
std::string filteredWalk(std::string const& dir, bool compressed, bool skip) {
    FS_Table table(L"fz", fuzzsupport::widen(dir).c_str(), compressed);
    if (!table.open()) return "not opened";
    std::string out = table.verify() ? "sound" : "damaged";
    Fields record(table.getFields());
    unsigned int column = 0;
    while (column < record.count() && record.at(column)->getType() != FIELD_TEXT) ++column;
    unsigned int id = 0, wanted = FS_Table::kNoRow, rows = 0;
    for (bool more = table.moveFirst(id); more && column < record.count(); more = table.moveNext(id)) {
        if (++rows > kMaxCursorRecords) std::abort();
        bool away = false;
        if (!(skip && id == wanted)) {
            const unsigned char* text = nullptr;
            uint32_t length = 0;
            bool ascii = false;
            away = table.peekText(id, column, &text, &length, &ascii) && ascii && evenLength(nullptr, text, length);
        }
        if (!away) {
            bool read = table.read(id, record);
            out += " " + std::to_string(id) + (read ? "" : " failed");
            if (!read) break;
        }
        if (skip) table.skipRejected(id, column, evenLength, nullptr, &wanted);
    }
    out += table.isDamaged() ? std::string(" / ") + table.damagedCheck() : " / none";
    table.close();
    if (verbose()) std::fprintf(stderr, "filtered walk%s: %s\n", skip ? " (skipping)" : "", out.c_str());
    return out;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    std::string const& dir = fuzzsupport::tempDir();
    fuzzsupport::ByteReader in(data, size);
    uint8_t flags = in.byte();
    uint16_t datLength = in.word16();
    uint16_t pxxLength = in.word16();
    uint16_t listLength = in.word16();
    uint32_t chainSlot = in.word32();
    std::string dat = in.take(datLength);
    std::string pxx = in.take(pxxLength);
    std::string list = in.take(listLength);
    // Index names become file names: keep them inside the directory.
    for (char& c : list)
        if (c == '/') c = '_';
    fuzzsupport::writeFile(dir + "/fz.dat", dat);
    fuzzsupport::writeFile(dir + "/fz.pxx", pxx);
    fuzzsupport::writeFile(dir + "/fz_idx.dat", list);
    std::string idxPath = dir + "/fzidx.idx";
    if (flags & 0x80) {
        uint32_t slots = Index::BUCKETS + ((flags >> 1) & 0x3f);
        std::string idx(static_cast<size_t>(slots) * 8, static_cast<char>(0xff));
        while (in.left() >= 12) {
            uint32_t slot = in.word32() % slots;
            uint32_t id = in.word32();
            uint32_t next = in.word32();
            for (int i = 0; i < 4; ++i) {
                idx[slot * 8 + i] = static_cast<char>(id >> (8 * i));
                idx[slot * 8 + 4 + i] = static_cast<char>(next >> (8 * i));
            }
        }
        fuzzsupport::writeFile(idxPath, idx);
    } else {
        unlink(idxPath.c_str());
    }

    {
        FS_Table table(L"fz", fuzzsupport::widen(dir).c_str(), (flags & 1) != 0);
        if (table.open()) {
            unsigned int stored = 0, deleted = 0;
            table.count(0, &stored);
            table.count(1, &deleted);
            table.eof();
            Fields record(table.getFields());
            unsigned int id = 0;
            bool more = table.moveFirst(id);
            while (more) {
                bool read = table.read(id, record);
                if (verbose()) {
                    std::fprintf(stderr, "record %u read %d:", id, read ? 1 : 0);
                    for (unsigned int i = 0; i < record.count(); ++i)
                        std::fprintf(stderr, " %ls", keyOf(record.at(i)).c_str());
                    std::fprintf(stderr, "\n");
                }
                if (read) lookUp(table, record);
                more = table.moveNext(id);
            }
            unsigned int last = 0, index = 0;
            table.moveLast(last, index);
            unsigned int back = last;
            for (int i = 0; i < 4 && table.movePrevious(back); ++i) table.read(back, record);
            for (Index* idx : table.getIndexes()) {
                unsigned int found = 0;
                walkChain(table, *idx, found, chainSlot);
                unsigned int slotId = 0, slotNext = 0;
                idx->read(chainSlot, &slotId, &slotNext);
            }
            table.close();
            // The walk that passes over rows inside the table must be the
            // row-by-row walk, whatever the bytes.
            bool compressed = (flags & 1) != 0;
            std::string rowByRow = filteredWalk(dir, compressed, false);
            std::string skipping = filteredWalk(dir, compressed, true);
            if (rowByRow != skipping) {
                std::fprintf(stderr, "row by row: %s\nskipping:   %s\n", rowByRow.c_str(), skipping.c_str());
                std::abort();
            }
        }
        table.erase();
    }
    return 0;
}
