// File checksums: CRC-32, Q32, MD5 and SHA-256, their text forms and the
// signature helpers built on MD5.
//
// CRC-32 is the reflected IEEE 802.3 polynomial (start value all ones, final
// inversion).  Q32 is the CRC-32 of the first 1024 bytes of a file, or of the
// whole file when it is shorter.  MD5 and SHA-256 are the standard digests.
//
// Text forms are lower-case hexadecimal, first byte first, followed by a NUL.
// Output buffers are the caller's and must hold at least the *_TEXT_SIZE bytes
// named below.  Nothing here allocates; every function may be used from any
// thread on its own context.
#ifndef FSCANNER_FSCOMMON_CHECKSUM_H
#define FSCANNER_FSCOMMON_CHECKSUM_H

#include <cstddef>
#include <cstdint>

// A raw MD5 digest, 16 bytes in digest order.
struct u_int128 {
    unsigned char bytes[16];
};

// A raw SHA-256 digest, 32 bytes in digest order.
struct u_int256 {
    unsigned char bytes[32];
};

bool operator==(u_int128 const& a, u_int128 const& b);
bool operator!=(u_int128 const& a, u_int128 const& b);
bool operator==(u_int256 const& a, u_int256 const& b);
bool operator!=(u_int256 const& a, u_int256 const& b);

// Which sums computeFileChecksumInfo is asked for.
const uint32_t FILE_CHECKSUM_CRC32 = 0x1;
const uint32_t FILE_CHECKSUM_Q32 = 0x2;
const uint32_t FILE_CHECKSUM_MD5 = 0x4;
const uint32_t FILE_CHECKSUM_SHA256 = 0x8;

// Bytes of the file that Q32 covers.
const size_t Q32_PREFIX_SIZE = 1024;

// Buffer sizes of the text forms, NUL included.
const size_t CRC32_TEXT_SIZE = 9;
const size_t MD5_TEXT_SIZE = 33;
const size_t SHA256_TEXT_SIZE = 65;

// The four sums of one file.  A new value has valid false, flags 0 and all
// sums zero.  The caller sets flags before computeFileChecksumInfo.
struct FileChecksumInfo {
    bool valid = false;
    uint32_t flags = 0;
    uint32_t crc32 = 0;
    uint32_t q32 = 0;
    u_int128 md5 = {};
    u_int256 sha256 = {};
};

// Computes the sums that info.flags asks for, in one pass over the file.
// Returns 0 on success, and also when flags is 0 (the file is then not even
// opened and valid is true); 2 when the file does not exist, 13 when access is
// denied, -1 on another failure to open (valid false and the sums untouched in
// these three cases); -2 when a read fails, in which case valid is false and
// the sums of what was read before the failure are stored.  Sums that were not
// asked for come out as the sums of empty input.  Calls
// CpuThreshold::doIteration() once after each sum is fed with a chunk.
// Only a regular file (or a directory, whose first read fails) is read: the
// open never blocks, and a pipe, a device or a socket gives -1 at once.
int computeFileChecksumInfo(FileChecksumInfo& info, char const* path);

// The walks' form, for a path that an lstat found to be a regular file: the
// entry may have been replaced since, so a link in the last component is not
// followed and anything but a regular file (a directory too) gives -1 with
// valid false and the sums untouched.  Otherwise as computeFileChecksumInfo.
int computeRegularFileChecksumInfo(FileChecksumInfo& info, char const* path);

// --- CRC-32 ---------------------------------------------------------------

struct crc32_context {
    uint32_t state;
};

void crc32_init(crc32_context* ctx);
void crc32_update(crc32_context* ctx, void const* data, size_t length);
// Returns the finished CRC; the context must be initialised again before reuse.
uint32_t crc32_final(crc32_context* ctx);
// Eight hexadecimal digits of the low 32 bits of crc ("%08lx"); out holds
// CRC32_TEXT_SIZE bytes.  Returns out.
char* crc32_tostr(unsigned long crc, char* out);

// --- MD5 ------------------------------------------------------------------

struct md5_context {
    uint32_t state[4];
    uint64_t length;          // bytes fed so far
    unsigned char buffer[64]; // the block being filled
};

void md5_init(md5_context* ctx);
void md5_update(md5_context* ctx, void const* data, size_t length);
// Writes the 16 digest bytes to digest (any 16-byte area, e.g. u_int128 or an
// array of four unsigned int).
void md5_final(md5_context* ctx, void* digest);
// Text form of 16 raw digest bytes; out holds MD5_TEXT_SIZE bytes.  Returns out.
char* md5_tostr(void const* digest, char* out);

// --- SHA-256 --------------------------------------------------------------

struct sha256_context {
    uint32_t state[8];
    uint64_t length;          // bytes fed so far
    unsigned char buffer[64]; // the block being filled
};

void sha256_init(sha256_context* ctx);
void sha256_update(sha256_context* ctx, void const* data, size_t length);
// Writes the 32 digest bytes to digest.
void sha256_final(sha256_context* ctx, void* digest);
// Text form of 32 raw digest bytes; out holds SHA256_TEXT_SIZE bytes.
char* sha256_tostr(void const* digest, char* out);

// --- Digest text ----------------------------------------------------------

// Text forms of a digest; out holds MD5_TEXT_SIZE (wide: characters) or
// SHA256_TEXT_SIZE bytes.  Return out.
char* md52char(u_int128 digest, char* out);
wchar_t* md52wchar_t(u_int128 digest, wchar_t* out);
char* sha256char(u_int256 digest, char* out);

// From text to digest.  The text is read as pairs of hexadecimal digits, in
// either case, first byte first.  The result holds the bytes of the pairs that
// were read and zeros behind them; a null text, a non-hexadecimal character or
// an odd digit ends the reading.  The bool forms return true only when the text
// is exactly the full digest (32 or 64 digits and nothing behind).
u_int128 char2md5(char const* text);
u_int128 wchar_t2md5(wchar_t const* text);
u_int256 char2sha256(char const* text);
u_int256 wchar_t2sha256(wchar_t const* text);
bool char2md5(char const* text, u_int128& out);
bool wchar_t2md5(wchar_t const* text, u_int128& out);
bool char2sha256(char const* text, u_int256& out);
bool wchar_t2sha256(wchar_t const* text, u_int256& out);
// Pointer forms of the above; a null out is refused with false.
bool char2md5(char const* text, u_int128* out);
bool wchar_t2md5(wchar_t const* text, u_int128* out);
bool char2sha256(char const* text, u_int256* out);
bool wchar_t2sha256(wchar_t const* text, u_int256* out);

// --- Signatures -----------------------------------------------------------
// Each writes the MD5 text form (MD5_TEXT_SIZE bytes) to out.

// MD5 of text without its NUL.  A null text counts as empty.
void getStringSignature_MD5(char* out, char const* text);

// One MD5 over a, b and c in this order, without their NULs.  A null text
// counts as empty.
void getHeaderSignature_MD5(char* out, char const* a, char const* b, char const* c);

// The wide form hands md5_update each text's length in characters as a byte
// count, so only the first quarter of each text's bytes enters the digest.
// Existing signatures depend on that, so it stays.
void getHeaderSignature_MD5(char* out, wchar_t const* a, wchar_t const* b, wchar_t const* c);

// One MD5 over first (skipped when null), second and the decimal text of
// number, each followed by pad zero bytes when pad is above 0.  pad above 1024
// or a null second is refused: out is made empty, a trace is written and the
// result is false.
bool getFileSignature_MD5(char* out, char const* first, char const* second, unsigned int number,
                          int pad);

#endif
