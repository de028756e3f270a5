// Parses an automounter master file and up to three maps, all of arbitrary
// bytes, through AutomounterConfigParser and PlainFileParser.  A thrown
// string is the parser's way to fail and is caught here as the drive list
// builder catches it.
//
// Input: master file, then the maps "m0", "m1", "m2" of the same directory,
// separated by bytes 0xFF.  Inputs that name device or kernel files are
// skipped: the targets read only their own files.
#include <cstddef>
#include <cstdint>
#include <string>

#include "fscanner/fscommon/automounter.h"
#include "fuzz_support.h"

extern "C" int LLVMFuzzerTestOneInput(uint8_t const* data, size_t size) {
    std::string const& dir = fuzzsupport::tempDir();
    std::string input(reinterpret_cast<char const*>(data), size);
    std::string parts[4];
    size_t start = 0;
    for (int i = 0; i < 4; ++i) {
        size_t end = i < 3 ? input.find('\xff', start) : std::string::npos;
        if (end == std::string::npos) {
            parts[i] = input.substr(start);
            start = input.size();
        } else {
            parts[i] = input.substr(start, end - start);
            start = end + 1;
        }
    }
    if (parts[0].find("/dev") != std::string::npos || parts[0].find("/proc") != std::string::npos ||
        parts[0].find("/sys") != std::string::npos)
        return 0;
    std::string master = dir + "/auto.master";
    fuzzsupport::writeFile(master, parts[0]);
    for (int i = 0; i < 3; ++i) fuzzsupport::writeFile(dir + "/m" + std::to_string(i), parts[i + 1]);

    AutomounterConfigParser parser(master);
    try {
        parser.parse();
    } catch (const std::string&) {
    }
    for (std::string const& point : parser.getLocalMountPoints()) (void)point.size();
    for (std::string const& point : parser.getRemoteMountPoints()) (void)point.size();
    return 0;
}
