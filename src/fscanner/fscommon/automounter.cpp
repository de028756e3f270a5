// Reader of the automounter's master file and plain maps.  See automounter.h.
#include "fscanner/fscommon/automounter.h"

#include <sys/types.h>

#include <cstdio>
#include <cstdlib>

#include "base/QvLogWrapper.h"
#include "fscanner/fscommon/env.h"
#include "fscanner/fscommon/stringhelper.h"

namespace {

// Tabs and blanks separate the fields of master and map lines.
const char* const kFieldDelimiters = " \t";

// The lines of a stream as std::getline gives them: without their line
// end, the last one also when no line end follows it.
std::vector<std::string> readLines(FILE* stream) {
    std::vector<std::string> lines;
    char* buffer = nullptr;
    size_t capacity = 0;
    ssize_t length;
    while ((length = ::getline(&buffer, &capacity, stream)) >= 0) {
        size_t n = static_cast<size_t>(length);
        if (n > 0 && buffer[n - 1] == '\n') --n;
        lines.push_back(std::string(buffer, n));
    }
    std::free(buffer);
    return lines;
}

}  // namespace

ParserDelegate::ParserDelegate(const std::string& type, const std::string& path, const std::string& format,
                               const std::string& point)
    : mapType(type), mapPath(path), mapFormat(format), mountPoint(point) {}

ParserDelegate::~ParserDelegate() {}

PlainFileParser::PlainFileParser(const std::string& type, const std::string& path, const std::string& format,
                                 const std::string& point)
    : ParserDelegate(type, path, format, point) {}

PlainFileParser::~PlainFileParser() {}

bool PlainFileParser::isRemote(const std::vector<std::string>& tokens) {
    if (tokens.empty()) return false;
    const std::string& location = tokens.back();
    if (!location.empty() && location[0] != ':' && location.find(':') != std::string::npos) return true;
    return location.compare(0, 3, "://") == 0;
}

void PlainFileParser::parse(std::vector<std::string>& remote, std::vector<std::string>& local) {
    QvLogWrapper* log = getQvLogFs();
    fscanner::Env* env = fscanner::Env::Current();
    FILE* map = env->openStream(mapPath.c_str(), "r");
    if (map == nullptr) throw std::string("Unable to open automounter map file: ") + mapPath;
    std::vector<std::string> lines = readLines(map);
    env->closeStream(map);

    for (const std::string& line : lines) {
        log->traceMAX(__LINE__, __FILE__, __FUNCTION__, "Map entry: '%s'", line.c_str());
        if (line.empty() || line[0] == '#') continue;

        std::vector<std::string> tokens = utils::split(line, kFieldDelimiters);
        if (tokens.size() < 2) throw std::string("Unknown map file format");

        const std::string& key = tokens[0];
        std::string directory = key[0] == '/' ? key : mountPoint + "/" + key;

        // A wildcard key stands for the directory above it.
        if (directory.find('*') != std::string::npos) {
            std::vector<std::string> pieces = utils::split(directory, "/");
            std::string cut;
            for (const std::string& piece : pieces) {
                if (piece.find('*') != std::string::npos) break;
                cut += "/" + piece;
            }
            directory = cut;
        }

        // A trailing "\" marks a continuation; the next line is still read as
        // an entry of its own.
        if (tokens.back() == "\\") tokens.pop_back();

        if (isRemote(tokens)) {
            remote.push_back(directory);
            log->traceMID(__LINE__, __FILE__, __FUNCTION__, "Mountpoint '%s' recognized as %s",
                          directory.c_str(), "remote");
        } else {
            local.push_back(directory);
            log->traceMID(__LINE__, __FILE__, __FUNCTION__, "Mountpoint '%s' recognized as %s",
                          directory.c_str(), "local");
        }
    }
}

const char* const AutomounterConfigParser::DEFAULT_MASTER_PATH = "/etc/auto.master";

AutomounterConfigParser::AutomounterConfigParser(const std::string& path)
    : localMountPoints(), remoteMountPoints(), masterPath(path), qvLog(getQvLogFs()) {}

AutomounterConfigParser::~AutomounterConfigParser() {}

void AutomounterConfigParser::parse() {
    fscanner::Env* env = fscanner::Env::Current();
    FILE* master = env->openStream(masterPath.c_str(), "r");
    if (master == nullptr) throw std::string("Unable to open automounter's master file ") + masterPath;
    std::vector<std::string> lines = readLines(master);
    env->closeStream(master);
    parseMasterLines(lines);
}

void AutomounterConfigParser::parseMaster(std::ifstream& master) {
    std::vector<std::string> lines;
    std::string line;
    while (std::getline(master, line)) lines.push_back(line);
    parseMasterLines(lines);
}

void AutomounterConfigParser::parseMasterLines(const std::vector<std::string>& lines) {
    for (const std::string& line : lines) {
        qvLog->traceMAX(__LINE__, __FILE__, __FUNCTION__, "Master file entry '%s'", line.c_str());
        // Leading white space is not stripped: an indented "#" is no comment.
        if (line.empty() || line[0] == '#' || line[0] == '+') continue;

        std::vector<std::string> tokens = utils::split(line, kFieldDelimiters);
        if (tokens.size() < 2) throw std::string("Automounter master file is of unknown format");

        const std::string& mountPoint = tokens[0];
        const std::string& definition = tokens[1];
        qvLog->traceMAX(__LINE__, __FILE__, __FUNCTION__, "Map mountpoint '%s', definition '%s",
                        mountPoint.c_str(), definition.c_str());

        std::vector<std::string> parts = utils::split(definition, ",:");
        // A definition of separators only has no map path; it is as malformed
        // as one of too many parts.
        if (parts.empty() || parts.size() > 3) throw std::string("Unknown format of automounter master file");

        std::string mapPath = parts.back();
        if (mapPath != "-hosts" && !mapPath.empty() && mapPath[0] != '/') {
            std::string::size_type slash = masterPath.rfind('/');
            std::string directory = slash == std::string::npos ? std::string(".") : masterPath.substr(0, slash);
            mapPath = directory + "/" + mapPath;
        }

        std::string mapType;
        std::string mapFormat;
        if (parts.size() == 1) {
            mapType = "file";
        } else {
            mapType = parts[0];
            if (parts.size() == 3) mapFormat = parts[1];
        }
        handleEntry(mapType, mapPath, mapFormat, mountPoint);
    }
}

void AutomounterConfigParser::handleEntry(std::string mapType, std::string mapPath, std::string mapFormat,
                                          std::string mountPoint) {
    qvLog->traceMAX(__LINE__, __FILE__, __FUNCTION__, "mapType='%s', mapPath='%s', mapFormat='%s', mountPoint='%s'",
                    mapType.c_str(), mapPath.c_str(), mapFormat.c_str(), mountPoint.c_str());
    if (mapType != "file") {
        qvLog->traceMIN(__LINE__, __FILE__, __FUNCTION__, "Map type '%s' not supported.", mapType.c_str());
        return;
    }
    PlainFileParser parser(mapType, mapPath, mapFormat, mountPoint);
    try {
        parser.parse(remoteMountPoints, localMountPoints);
    } catch (const std::string& failure) {
        qvLog->traceMIN(__LINE__, __FILE__, __FUNCTION__, "Map parsing failed: %s", failure.c_str());
    }
}
