// On-disk layout of a table.  Every number is in host byte order (codec.h
// fixed32/fixed16), a wide character is 4 bytes.  There is no magic, version
// or checksum, and whether integers are compressed is not recorded: a table is
// opened with the flag it was created with.
//
// <dir><name>.dat, the data file:
//
//   offset 0   4  stored count   live records, unsigned
//   offset 4   4  deleted count  removed records since the last compaction
//   offset 8   4  field count
//   offset 12     one descriptor per field:
//                   4  type number (1..6, see fields.h)
//                   4  name length in bytes (characters * 4)
//                   n  name, 4-byte wide characters, no terminator
//   header size = 12 + sum(8 + name bytes); records follow directly:
//
//   record:   ceil(field count / 8) bytes of presence bits, then the values in
//             column order.  Bit i (field i) is set when the field's null flag
//             was set at writing; bits run from the most significant end:
//             field 0 = 0x80 of byte 0, field 7 = 0x01 of byte 0, field 8 =
//             0x80 of byte 1.  A value is written even when its bit is set.
//
//   value     plain table                  compressed table
//   type 1    1 byte                       1 byte
//   type 2    2 bytes                      7-bit groups (codec.h)
//   type 3    4 bytes                      7-bit groups
//   type 4    8 bytes                      7-bit groups
//   type 5    2-byte length + UTF-8 bytes  7-bit group length + UTF-8 bytes
//   type 6    nothing                      nothing
//   The text length is the UTF-8 byte count cut to 16 bits, and only that many
//   bytes are written.
//
// <dir><name>.pxx, the pointer file: no header, one 4-byte slot per record
// number; slot n at offset n * 4 holds the data offset of record n, or 0 when
// the record was removed (offset 0 is the header, never a record).  The next
// record number is the file's logical size / 4.
//
// <dir><name>_idx.dat, the index list: entries one after another, no header:
//   4 tag (110; other tags are skipped), 4 index name bytes, index name,
//   4 field name bytes, field name (4-byte wide characters, no terminator).
//
// After a crash both files stand at their allocated size (multiples of 16 MiB),
// zero-padded: zero slots read as removed records and the data padding is
// never pointed at, so the table walks as before.
#ifndef FSCANNER_FSCOMMON_TABLE_FORMAT_H
#define FSCANNER_FSCOMMON_TABLE_FORMAT_H

#include <cstdint>

namespace tableformat {

const uint32_t kStoredCountOffset = 0;
const uint32_t kDeletedCountOffset = 4;
const uint32_t kFieldCountOffset = 8;
const uint32_t kFixedHeaderSize = 12;

const uint32_t kDescriptorTypeSize = 4;
const uint32_t kDescriptorNameLengthSize = 4;
const uint32_t kDescriptorFixedSize = kDescriptorTypeSize + kDescriptorNameLengthSize;
const uint32_t kWideCharSize = 4;

// The presence bitmap is built in a buffer of this many bytes: at most 256 fields.
const uint32_t kBitmapBufferSize = 32;
const uint32_t kMaxFields = kBitmapBufferSize * 8;

const uint32_t kSlotSize = 4;
const uint32_t kRemovedSlot = 0;

const uint32_t kPlainTextLengthSize = 2;
// Buffer handed to compressInt by the table.
const int kCompressBufferSize = 16;
// Texts of more UTF-8 bytes than this are read through a heap block.
const uint32_t kInlineTextBytes = 255;

const uint32_t kIndexListTag = 110;

// The files' names (".dat", ".pxx", "_idx.dat", the lock's "_t_mutex") are
// given in cache_files.h, with every other file of a cache directory.

inline uint32_t bitmapBytes(uint32_t fieldCount) { return (fieldCount + 7) / 8; }

}  // namespace tableformat

#endif
