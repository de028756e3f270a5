#include "fscanner/fscommon/checksum.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <cwchar>

#include "base/CpuThreshold.h"
#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/env.h"

bool operator==(u_int128 const& a, u_int128 const& b) {
    return std::memcmp(a.bytes, b.bytes, sizeof a.bytes) == 0;
}
bool operator!=(u_int128 const& a, u_int128 const& b) { return !(a == b); }
bool operator==(u_int256 const& a, u_int256 const& b) {
    return std::memcmp(a.bytes, b.bytes, sizeof a.bytes) == 0;
}
bool operator!=(u_int256 const& a, u_int256 const& b) { return !(a == b); }

namespace {

const char kHexDigits[] = "0123456789abcdef";

// Lower-case hexadecimal of count bytes, NUL-terminated.
template <typename CharT>
CharT* bytesToHex(unsigned char const* bytes, size_t count, CharT* out) {
    for (size_t i = 0; i < count; ++i) {
        out[2 * i] = static_cast<CharT>(kHexDigits[bytes[i] >> 4]);
        out[2 * i + 1] = static_cast<CharT>(kHexDigits[bytes[i] & 0x0f]);
    }
    out[2 * count] = 0;
    return out;
}

template <typename CharT>
int hexValue(CharT c) {
    if (c >= '0' && c <= '9') return static_cast<int>(c - '0');
    if (c >= 'a' && c <= 'f') return static_cast<int>(c - 'a') + 10;
    if (c >= 'A' && c <= 'F') return static_cast<int>(c - 'A') + 10;
    return -1;
}

// Reads pairs of hex digits into bytes (zeroed first).  True when exactly
// count pairs were read and the text ends behind them.
template <typename CharT>
bool hexToBytes(CharT const* text, unsigned char* bytes, size_t count) {
    std::memset(bytes, 0, count);
    if (text == nullptr) return false;
    size_t i = 0;
    for (; i < count; ++i) {
        int hi = hexValue(text[2 * i]);
        if (hi < 0) return false;
        int lo = hexValue(text[2 * i + 1]);
        if (lo < 0) return false;
        bytes[i] = static_cast<unsigned char>((hi << 4) | lo);
    }
    return text[2 * count] == 0;
}

// --- CRC-32 tables ----------------------------------------------------------

struct Crc32Table {
    uint32_t entries[256];
    Crc32Table() {
        for (uint32_t n = 0; n < 256; ++n) {
            uint32_t c = n;
            for (int k = 0; k < 8; ++k) c = (c & 1) ? (0xEDB88320u ^ (c >> 1)) : (c >> 1);
            entries[n] = c;
        }
    }
};

const Crc32Table& crcTable() {
    static const Crc32Table table;
    return table;
}

// --- MD5 ----------------------------------------------------------------------

inline uint32_t rotl(uint32_t x, int n) { return (x << n) | (x >> (32 - n)); }
inline uint32_t rotr(uint32_t x, int n) { return (x >> n) | (x << (32 - n)); }

inline uint32_t loadLE32(unsigned char const* p) {
    return static_cast<uint32_t>(p[0]) | (static_cast<uint32_t>(p[1]) << 8) |
           (static_cast<uint32_t>(p[2]) << 16) | (static_cast<uint32_t>(p[3]) << 24);
}
inline void storeLE32(uint32_t v, unsigned char* p) {
    p[0] = static_cast<unsigned char>(v);
    p[1] = static_cast<unsigned char>(v >> 8);
    p[2] = static_cast<unsigned char>(v >> 16);
    p[3] = static_cast<unsigned char>(v >> 24);
}
inline uint32_t loadBE32(unsigned char const* p) {
    return (static_cast<uint32_t>(p[0]) << 24) | (static_cast<uint32_t>(p[1]) << 16) |
           (static_cast<uint32_t>(p[2]) << 8) | static_cast<uint32_t>(p[3]);
}
inline void storeBE32(uint32_t v, unsigned char* p) {
    p[0] = static_cast<unsigned char>(v >> 24);
    p[1] = static_cast<unsigned char>(v >> 16);
    p[2] = static_cast<unsigned char>(v >> 8);
    p[3] = static_cast<unsigned char>(v);
}

const uint32_t kMd5Sines[64] = {
    0xd76aa478, 0xe8c7b756, 0x242070db, 0xc1bdceee, 0xf57c0faf, 0x4787c62a, 0xa8304613,
    0xfd469501, 0x698098d8, 0x8b44f7af, 0xffff5bb1, 0x895cd7be, 0x6b901122, 0xfd987193,
    0xa679438e, 0x49b40821, 0xf61e2562, 0xc040b340, 0x265e5a51, 0xe9b6c7aa, 0xd62f105d,
    0x02441453, 0xd8a1e681, 0xe7d3fbc8, 0x21e1cde6, 0xc33707d6, 0xf4d50d87, 0x455a14ed,
    0xa9e3e905, 0xfcefa3f8, 0x676f02d9, 0x8d2a4c8a, 0xfffa3942, 0x8771f681, 0x6d9d6122,
    0xfde5380c, 0xa4beea44, 0x4bdecfa9, 0xf6bb4b60, 0xbebfbc70, 0x289b7ec6, 0xeaa127fa,
    0xd4ef3085, 0x04881d05, 0xd9d4d039, 0xe6db99e5, 0x1fa27cf8, 0xc4ac5665, 0xf4292244,
    0x432aff97, 0xab9423a7, 0xfc93a039, 0x655b59c3, 0x8f0ccc92, 0xffeff47d, 0x85845dd1,
    0x6fa87e4f, 0xfe2ce6e0, 0xa3014314, 0x4e0811a1, 0xf7537e82, 0xbd3af235, 0x2ad7d2bb,
    0xeb86d391};

const int kMd5Shifts[64] = {7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22, 7, 12, 17, 22,
                            5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20, 5, 9,  14, 20,
                            4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23, 4, 11, 16, 23,
                            6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21, 6, 10, 15, 21};

void md5Block(uint32_t state[4], unsigned char const* block) {
    uint32_t m[16];
    for (int i = 0; i < 16; ++i) m[i] = loadLE32(block + 4 * i);
    uint32_t a = state[0], b = state[1], c = state[2], d = state[3];
    for (int i = 0; i < 64; ++i) {
        uint32_t f;
        int g;
        if (i < 16) {
            f = (b & c) | (~b & d);
            g = i;
        } else if (i < 32) {
            f = (d & b) | (~d & c);
            g = (5 * i + 1) & 15;
        } else if (i < 48) {
            f = b ^ c ^ d;
            g = (3 * i + 5) & 15;
        } else {
            f = c ^ (b | ~d);
            g = (7 * i) & 15;
        }
        uint32_t t = d;
        d = c;
        c = b;
        b = b + rotl(a + f + kMd5Sines[i] + m[g], kMd5Shifts[i]);
        a = t;
    }
    state[0] += a;
    state[1] += b;
    state[2] += c;
    state[3] += d;
}

// --- SHA-256 ------------------------------------------------------------------

const uint32_t kSha256Rounds[64] = {
    0x428a2f98, 0x71374491, 0xb5c0fbcf, 0xe9b5dba5, 0x3956c25b, 0x59f111f1, 0x923f82a4,
    0xab1c5ed5, 0xd807aa98, 0x12835b01, 0x243185be, 0x550c7dc3, 0x72be5d74, 0x80deb1fe,
    0x9bdc06a7, 0xc19bf174, 0xe49b69c1, 0xefbe4786, 0x0fc19dc6, 0x240ca1cc, 0x2de92c6f,
    0x4a7484aa, 0x5cb0a9dc, 0x76f988da, 0x983e5152, 0xa831c66d, 0xb00327c8, 0xbf597fc7,
    0xc6e00bf3, 0xd5a79147, 0x06ca6351, 0x14292967, 0x27b70a85, 0x2e1b2138, 0x4d2c6dfc,
    0x53380d13, 0x650a7354, 0x766a0abb, 0x81c2c92e, 0x92722c85, 0xa2bfe8a1, 0xa81a664b,
    0xc24b8b70, 0xc76c51a3, 0xd192e819, 0xd6990624, 0xf40e3585, 0x106aa070, 0x19a4c116,
    0x1e376c08, 0x2748774c, 0x34b0bcb5, 0x391c0cb3, 0x4ed8aa4a, 0x5b9cca4f, 0x682e6ff3,
    0x748f82ee, 0x78a5636f, 0x84c87814, 0x8cc70208, 0x90befffa, 0xa4506ceb, 0xbef9a3f7,
    0xc67178f2};

void sha256Block(uint32_t state[8], unsigned char const* block) {
    uint32_t w[64];
    for (int i = 0; i < 16; ++i) w[i] = loadBE32(block + 4 * i);
    for (int i = 16; i < 64; ++i) {
        uint32_t s0 = rotr(w[i - 15], 7) ^ rotr(w[i - 15], 18) ^ (w[i - 15] >> 3);
        uint32_t s1 = rotr(w[i - 2], 17) ^ rotr(w[i - 2], 19) ^ (w[i - 2] >> 10);
        w[i] = w[i - 16] + s0 + w[i - 7] + s1;
    }
    uint32_t a = state[0], b = state[1], c = state[2], d = state[3];
    uint32_t e = state[4], f = state[5], g = state[6], h = state[7];
    for (int i = 0; i < 64; ++i) {
        uint32_t S1 = rotr(e, 6) ^ rotr(e, 11) ^ rotr(e, 25);
        uint32_t ch = (e & f) ^ (~e & g);
        uint32_t t1 = h + S1 + ch + kSha256Rounds[i] + w[i];
        uint32_t S0 = rotr(a, 2) ^ rotr(a, 13) ^ rotr(a, 22);
        uint32_t maj = (a & b) ^ (a & c) ^ (b & c);
        uint32_t t2 = S0 + maj;
        h = g;
        g = f;
        f = e;
        e = d + t1;
        d = c;
        c = b;
        b = a;
        a = t1 + t2;
    }
    state[0] += a;
    state[1] += b;
    state[2] += c;
    state[3] += d;
    state[4] += e;
    state[5] += f;
    state[6] += g;
    state[7] += h;
}

// Feeds bytes into a 64-byte block buffer, running blockFn on every full block.
template <typename Ctx, typename BlockFn>
void feedBlocks(Ctx* ctx, void const* data, size_t length, BlockFn blockFn) {
    unsigned char const* p = static_cast<unsigned char const*>(data);
    size_t used = static_cast<size_t>(ctx->length % 64);
    ctx->length += length;
    if (used != 0) {
        size_t take = 64 - used;
        if (take > length) take = length;
        std::memcpy(ctx->buffer + used, p, take);
        used += take;
        p += take;
        length -= take;
        if (used < 64) return;
        blockFn(ctx->state, ctx->buffer);
    }
    while (length >= 64) {
        blockFn(ctx->state, p);
        p += 64;
        length -= 64;
    }
    if (length > 0) std::memcpy(ctx->buffer, p, length);
}

// The closing padding shared by MD5 and SHA-256: 0x80, zeros, and the bit
// length in the last 8 bytes, little-endian for MD5 and big-endian for SHA-256.
template <typename Ctx, typename BlockFn>
void padBlocks(Ctx* ctx, bool bigEndianLength, BlockFn blockFn) {
    uint64_t bits = ctx->length * 8;
    size_t used = static_cast<size_t>(ctx->length % 64);
    ctx->buffer[used++] = 0x80;
    if (used > 56) {
        std::memset(ctx->buffer + used, 0, 64 - used);
        blockFn(ctx->state, ctx->buffer);
        used = 0;
    }
    std::memset(ctx->buffer + used, 0, 56 - used);
    for (int i = 0; i < 8; ++i) {
        int shift = bigEndianLength ? 8 * (7 - i) : 8 * i;
        ctx->buffer[56 + i] = static_cast<unsigned char>(bits >> shift);
    }
    blockFn(ctx->state, ctx->buffer);
}

}  // namespace

// --- CRC-32 -------------------------------------------------------------------

void crc32_init(crc32_context* ctx) { ctx->state = 0xFFFFFFFFu; }

void crc32_update(crc32_context* ctx, void const* data, size_t length) {
    const uint32_t* table = crcTable().entries;
    unsigned char const* p = static_cast<unsigned char const*>(data);
    uint32_t c = ctx->state;
    for (size_t i = 0; i < length; ++i) c = table[(c ^ p[i]) & 0xFF] ^ (c >> 8);
    ctx->state = c;
}

uint32_t crc32_final(crc32_context* ctx) { return ctx->state ^ 0xFFFFFFFFu; }

char* crc32_tostr(unsigned long crc, char* out) {
    std::snprintf(out, CRC32_TEXT_SIZE, "%08lx", crc & 0xFFFFFFFFul);
    return out;
}

// --- MD5 ----------------------------------------------------------------------

void md5_init(md5_context* ctx) {
    ctx->state[0] = 0x67452301u;
    ctx->state[1] = 0xefcdab89u;
    ctx->state[2] = 0x98badcfeu;
    ctx->state[3] = 0x10325476u;
    ctx->length = 0;
    std::memset(ctx->buffer, 0, sizeof ctx->buffer);
}

void md5_update(md5_context* ctx, void const* data, size_t length) {
    if (length == 0) return;
    feedBlocks(ctx, data, length, md5Block);
}

void md5_final(md5_context* ctx, void* digest) {
    padBlocks(ctx, false, md5Block);
    unsigned char* out = static_cast<unsigned char*>(digest);
    for (int i = 0; i < 4; ++i) storeLE32(ctx->state[i], out + 4 * i);
}

char* md5_tostr(void const* digest, char* out) {
    return bytesToHex(static_cast<unsigned char const*>(digest), 16, out);
}

// --- SHA-256 ------------------------------------------------------------------

void sha256_init(sha256_context* ctx) {
    static const uint32_t initial[8] = {0x6a09e667, 0xbb67ae85, 0x3c6ef372, 0xa54ff53a,
                                        0x510e527f, 0x9b05688c, 0x1f83d9ab, 0x5be0cd19};
    std::memcpy(ctx->state, initial, sizeof initial);
    ctx->length = 0;
    std::memset(ctx->buffer, 0, sizeof ctx->buffer);
}

void sha256_update(sha256_context* ctx, void const* data, size_t length) {
    if (length == 0) return;
    feedBlocks(ctx, data, length, sha256Block);
}

void sha256_final(sha256_context* ctx, void* digest) {
    padBlocks(ctx, true, sha256Block);
    unsigned char* out = static_cast<unsigned char*>(digest);
    for (int i = 0; i < 8; ++i) storeBE32(ctx->state[i], out + 4 * i);
}

char* sha256_tostr(void const* digest, char* out) {
    return bytesToHex(static_cast<unsigned char const*>(digest), 32, out);
}

// --- Digest text ----------------------------------------------------------------

char* md52char(u_int128 digest, char* out) { return bytesToHex(digest.bytes, 16, out); }

wchar_t* md52wchar_t(u_int128 digest, wchar_t* out) { return bytesToHex(digest.bytes, 16, out); }

char* sha256char(u_int256 digest, char* out) { return bytesToHex(digest.bytes, 32, out); }

bool char2md5(char const* text, u_int128& out) { return hexToBytes(text, out.bytes, 16); }
bool wchar_t2md5(wchar_t const* text, u_int128& out) { return hexToBytes(text, out.bytes, 16); }
bool char2sha256(char const* text, u_int256& out) { return hexToBytes(text, out.bytes, 32); }
bool wchar_t2sha256(wchar_t const* text, u_int256& out) { return hexToBytes(text, out.bytes, 32); }

bool char2md5(char const* text, u_int128* out) { return out != nullptr && char2md5(text, *out); }
bool wchar_t2md5(wchar_t const* text, u_int128* out) {
    return out != nullptr && wchar_t2md5(text, *out);
}
bool char2sha256(char const* text, u_int256* out) {
    return out != nullptr && char2sha256(text, *out);
}
bool wchar_t2sha256(wchar_t const* text, u_int256* out) {
    return out != nullptr && wchar_t2sha256(text, *out);
}

u_int128 char2md5(char const* text) {
    u_int128 d;
    char2md5(text, d);
    return d;
}
u_int128 wchar_t2md5(wchar_t const* text) {
    u_int128 d;
    wchar_t2md5(text, d);
    return d;
}
u_int256 char2sha256(char const* text) {
    u_int256 d;
    char2sha256(text, d);
    return d;
}
u_int256 wchar_t2sha256(wchar_t const* text) {
    u_int256 d;
    wchar_t2sha256(text, d);
    return d;
}

// --- Signatures -------------------------------------------------------------------

void getStringSignature_MD5(char* out, char const* text) {
    md5_context ctx;
    md5_init(&ctx);
    if (text != nullptr) md5_update(&ctx, text, std::strlen(text));
    unsigned char digest[16];
    md5_final(&ctx, digest);
    md5_tostr(digest, out);
}

void getHeaderSignature_MD5(char* out, char const* a, char const* b, char const* c) {
    md5_context ctx;
    md5_init(&ctx);
    char const* parts[3] = {a, b, c};
    for (char const* part : parts) {
        if (part != nullptr) md5_update(&ctx, part, std::strlen(part));
    }
    unsigned char digest[16];
    md5_final(&ctx, digest);
    md5_tostr(digest, out);
}

void getHeaderSignature_MD5(char* out, wchar_t const* a, wchar_t const* b, wchar_t const* c) {
    md5_context ctx;
    md5_init(&ctx);
    wchar_t const* parts[3] = {a, b, c};
    for (wchar_t const* part : parts) {
        // The length in characters stands as the byte count: only the first
        // quarter of the text's bytes is digested.
        if (part != nullptr) md5_update(&ctx, part, std::wcslen(part));
    }
    unsigned char digest[16];
    md5_final(&ctx, digest);
    md5_tostr(digest, out);
}

bool getFileSignature_MD5(char* out, char const* first, char const* second, unsigned int number,
                          int pad) {
    static const unsigned char zeros[1024] = {0};
    if (pad > static_cast<int>(sizeof zeros) || second == nullptr) {
        out[0] = '\0';
        getQvLogFs()->traceMIN(__LINE__, __FILE__, "getFileSignature_MD5",
                               "getFileSignature_MD5 - refused: pad %d, second %s\n", pad,
                               second == nullptr ? "null" : "given");
        return false;
    }
    char numberText[16];
    std::snprintf(numberText, sizeof numberText, "%u", number);
    char const* pieces[3] = {first, second, numberText};
    md5_context ctx;
    md5_init(&ctx);
    for (char const* piece : pieces) {
        if (piece == nullptr) continue;
        md5_update(&ctx, piece, std::strlen(piece));
        if (pad > 0) md5_update(&ctx, zeros, static_cast<size_t>(pad));
    }
    unsigned char digest[16];
    md5_final(&ctx, digest);
    md5_tostr(digest, out);
    return true;
}

// --- File sums --------------------------------------------------------------------

namespace {

// Opens path for reading without ever blocking in the open and without
// reading anything that would not end: a pipe without a writer or a device
// that waits for its medium would block in a plain open, and a device such
// as /dev/zero reads for ever.  O_NONBLOCK keeps the open from blocking, the
// fstat that follows refuses every kind but a regular file (a directory too,
// unless directories is set: its open succeeds and its first read fails, as
// it always has), and the non-blocking mode is cleared again before the
// first read, so a regular file is read exactly as fopen would read it.
// With followLinks false, O_NOFOLLOW refuses a link in the last component.
// A refused kind gives null with errno EINVAL.  Null path: null, errno
// untouched.
FILE* openForSums(char const* path, bool followLinks, bool directories) {
    if (path == nullptr) return nullptr;
    fscanner::Env* env = fscanner::Env::Current();
    int flags = O_RDONLY | O_NONBLOCK | O_CLOEXEC;
    if (!followLinks) flags |= O_NOFOLLOW;
    int fd = env->openFile(path, flags);
    if (fd < 0) return nullptr;
    struct stat status;
    if (env->fileStatus(fd, &status) != 0) {
        int error = errno;
        env->closeFile(fd);
        errno = error;
        return nullptr;
    }
    if (!S_ISREG(status.st_mode) && !(directories && S_ISDIR(status.st_mode))) {
        env->closeFile(fd);
        errno = EINVAL;
        return nullptr;
    }
    int mode = env->fileControl(fd, F_GETFL, 0);
    if (mode < 0 || env->fileControl(fd, F_SETFL, mode & ~O_NONBLOCK) != 0) {
        int error = errno;
        env->closeFile(fd);
        errno = error;
        return nullptr;
    }
    FILE* file = env->openStreamOnFd(fd, "rb");
    if (file == nullptr) {
        int error = errno;
        env->closeFile(fd);
        errno = error;
    }
    return file;
}

int computeSums(FileChecksumInfo& info, char const* path, bool followLinks, bool directories);

}  // namespace

int computeFileChecksumInfo(FileChecksumInfo& info, char const* path) {
    return computeSums(info, path, true, true);
}

int computeRegularFileChecksumInfo(FileChecksumInfo& info, char const* path) {
    return computeSums(info, path, false, false);
}

namespace {

int computeSums(FileChecksumInfo& info, char const* path, bool followLinks, bool directories) {
    info.valid = true;
    const uint32_t wanted = info.flags;
    if (wanted == 0) return 0;

    FILE* file = openForSums(path, followLinks, directories);
    if (file == nullptr) {
        int error = path != nullptr ? errno : EINVAL;
        info.valid = false;
        if (error == ENOENT) return 2;
        if (error == EACCES) return 13;
        return -1;
    }

    const bool wantCrc = (wanted & FILE_CHECKSUM_CRC32) != 0;
    const bool wantQ32 = (wanted & FILE_CHECKSUM_Q32) != 0;
    const bool wantMd5 = (wanted & FILE_CHECKSUM_MD5) != 0;
    const bool wantSha = (wanted & FILE_CHECKSUM_SHA256) != 0;
    const bool q32Only = (wanted & 0xF) == FILE_CHECKSUM_Q32;

    // Q32 with SHA-256 and nothing else reads in Q32-sized chunks; every other
    // mix, Q32 alone included, reads 4096 bytes at a time.
    const size_t readSize = (!wantMd5 && !wantCrc && wantQ32 && wantSha) ? 1024 : 4096;

    crc32_context crcCtx;
    crc32_context q32Ctx;
    md5_context md5Ctx;
    sha256_context shaCtx;
    crc32_init(&crcCtx);
    crc32_init(&q32Ctx);
    md5_init(&md5Ctx);
    sha256_init(&shaCtx);

    int result = 0;
    bool firstChunk = true;
    unsigned char buffer[4096];
    for (;;) {
        size_t got = std::fread(buffer, 1, readSize, file);
        if (got < readSize && !std::feof(file)) {
            // A short read that is not the end of the file: a read error.
            info.valid = false;
            result = -2;
            break;
        }
        if (got == 0) break;
        if (wantMd5) {
            md5_update(&md5Ctx, buffer, got);
            CpuThreshold::doIteration();
        }
        if (wantSha) {
            sha256_update(&shaCtx, buffer, got);
            CpuThreshold::doIteration();
        }
        if (wantCrc) {
            crc32_update(&crcCtx, buffer, got);
            CpuThreshold::doIteration();
        }
        if (firstChunk) {
            firstChunk = false;
            if (wantQ32) {
                crc32_update(&q32Ctx, buffer, got < Q32_PREFIX_SIZE ? got : Q32_PREFIX_SIZE);
                CpuThreshold::doIteration();
                if (q32Only) break;  // a large file costs one read
            }
        }
    }

    // Runs on the failure path too, so the sums of a partial read are kept.
    info.crc32 = crc32_final(&crcCtx);
    info.q32 = crc32_final(&q32Ctx);
    md5_final(&md5Ctx, info.md5.bytes);
    sha256_final(&shaCtx, info.sha256.bytes);
    fscanner::Env::Current()->closeStream(file);
    return result;
}

}  // namespace
