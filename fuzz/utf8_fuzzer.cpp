// The UTF-8 and multibyte conversions on arbitrary text: decoding bytes into
// output areas of every small size, encoding wide text into exact-size areas
// and into the growing buffer, and the round trip encode-then-decode, which
// must give the text back (characters beyond U+10FFFF as "?").
//
// Input: 1 control byte (bits 0-5 an output size, bit 7 the text is 32-bit
// little-endian wide characters rather than bytes), then the text.
#include <clocale>
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "fscanner/fscommon/stringhelper.h"
#include "fscanner/fscommon/utils.h"
#include "fuzz_support.h"

namespace {

void decode(std::string const& bytes, unsigned int size) {
    std::vector<wchar_t> out(size == 0 ? 1 : size, L'#');
    std::string text(bytes.c_str());  // the decoder reads up to the first NUL
    unsigned int n = utils::utf8ToWideChar(size == 0 ? nullptr : out.data(), size,
                                           reinterpret_cast<unsigned char const*>(text.c_str()));
    if (size == 0) {
        if (n != 0) std::abort();
        return;
    }
    if (n > size - 1 || out[n] != 0) std::abort();
}

void encode(std::wstring const& text, unsigned int size) {
    std::vector<unsigned char> out(size == 0 ? 1 : size, '#');
    unsigned int n = utils::stringToUTF8(size == 0 ? nullptr : out.data(), size, text.c_str());
    if (size == 0) {
        if (n != 0) std::abort();
        return;
    }
    size_t bytes = std::strlen(reinterpret_cast<char*>(out.data()));
    if (bytes > size - 1 || n > text.size()) std::abort();
}

void roundTrip(std::wstring const& text) {
    utils::DynamicBuffer<unsigned char> buffer;
    unsigned int encoded = utils::stringToUTF8(buffer, text.c_str());
    if (encoded != text.size()) std::abort();
    std::vector<wchar_t> back(text.size() + 1);
    unsigned int decoded = utils::utf8ToWideChar(back.data(), static_cast<unsigned int>(back.size()), buffer.get());
    if (decoded != text.size()) std::abort();
    for (size_t i = 0; i < text.size(); ++i) {
        uint32_t c = static_cast<uint32_t>(text[i]);
        wchar_t expected = c < 0x110000 ? text[i] : L'?';
        if (back[i] != expected) std::abort();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    static bool locale = std::setlocale(LC_ALL, "C.UTF-8") != nullptr;
    (void)locale;
    fuzzsupport::ByteReader in(data, size);
    uint8_t control = in.byte();
    unsigned int outSize = control & 0x3f;
    std::string bytes = in.rest();

    std::wstring text;
    if (control & 0x80) {
        for (size_t i = 0; i + 4 <= bytes.size(); i += 4) {
            uint32_t c = static_cast<uint32_t>(static_cast<unsigned char>(bytes[i])) |
                         (static_cast<uint32_t>(static_cast<unsigned char>(bytes[i + 1])) << 8) |
                         (static_cast<uint32_t>(static_cast<unsigned char>(bytes[i + 2])) << 16) |
                         (static_cast<uint32_t>(static_cast<unsigned char>(bytes[i + 3])) << 24);
            text.push_back(static_cast<wchar_t>(c == 0 ? 1 : c));
        }
    } else {
        std::string narrow(bytes.c_str());
        std::vector<wchar_t> wide(narrow.size() + 1);
        utils::utf8ToWideChar(wide.data(), static_cast<unsigned int>(wide.size()),
                              reinterpret_cast<unsigned char const*>(narrow.c_str()));
        text = wide.data();
    }

    decode(bytes, outSize);
    decode(bytes, static_cast<unsigned int>(bytes.size() + 1));
    encode(text, outSize);
    encode(text, static_cast<unsigned int>(text.size() * 4 + 1));
    roundTrip(text);

    std::string narrow(bytes.c_str());
    wchar_t* wide = utils::myMbsToWcsString(narrow.c_str());
    if (wide == nullptr) std::abort();
    char* back = utils::myWcsToMbsString(wide);
    if (back == nullptr) std::abort();
    delete[] back;
    delete[] wide;
    char* fromText = utils::myWcsToMbsString(text.c_str());
    delete[] fromText;
    return 0;
}
