#include "support/testsupport.h"

#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "fscanner/fscommon/sync.h"

namespace testsupport {

TempDir::TempDir() {
    const char* base = std::getenv("TMPDIR");
    std::string pattern = std::string(base != nullptr && *base != '\0' ? base : "/tmp") +
                          "/fscanner-test-XXXXXX";
    std::vector<char> buf(pattern.begin(), pattern.end());
    buf.push_back('\0');
    if (mkdtemp(buf.data()) == nullptr) throw std::runtime_error("mkdtemp failed");
    path_ = buf.data();
}

TempDir::~TempDir() { removeTree(path_); }

std::string TempDir::file(const std::string& relative) const { return path_ + "/" + relative; }

LockStore::LockStore()
    : saved_(LinuxSharedMutex::storePath, sizeof LinuxSharedMutex::storePath),
      ok_(LinuxSharedMutex::setStorePath(dir_.path().c_str())) {}

LockStore::~LockStore() { std::memcpy(LinuxSharedMutex::storePath, saved_.data(), saved_.size()); }

std::string TempDir::mkdirs(const std::string& relative) const {
    std::string full = path_;
    std::stringstream ss(relative);
    std::string part;
    while (std::getline(ss, part, '/')) {
        if (part.empty()) continue;
        full += "/" + part;
        mkdir(full.c_str(), 0755);
    }
    return full;
}

std::string TempDir::write(const std::string& relative, const std::string& content) const {
    size_t slash = relative.rfind('/');
    if (slash != std::string::npos) mkdirs(relative.substr(0, slash));
    std::string full = file(relative);
    std::ofstream out(full, std::ios::binary | std::ios::trunc);
    out << content;
    return full;
}

std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    std::stringstream ss;
    ss << in.rdbuf();
    return ss.str();
}

bool writeBytes(const std::string& path, const void* data, size_t size) {
    std::FILE* out = std::fopen(path.c_str(), "wb");
    if (out == nullptr) return false;
    bool written = size == 0 || std::fwrite(data, 1, size, out) == size;
    return std::fclose(out) == 0 && written;
}

bool fileExists(const std::string& path) {
    struct stat st;
    return lstat(path.c_str(), &st) == 0;
}

void removeTree(const std::string& path) {
    if (path.empty() || path == "/") return;
    std::string quoted = "'";
    for (char c : path) {
        if (c == '\'')
            quoted += "'\\''";
        else
            quoted += c;
    }
    quoted += "'";
    std::string cmd = "chmod -R u+rwx " + quoted + " 2>/dev/null; rm -rf " + quoted;
    int rc = std::system(cmd.c_str());
    (void)rc;
}

TraceCapture::TraceCapture(int maxLevel) { getQvLogFs()->startCapture(maxLevel); }

TraceCapture::~TraceCapture() { getQvLogFs()->stopCapture(); }

std::vector<QvLogWrapper::Message> TraceCapture::messages() const {
    return getQvLogFs()->captured();
}

bool TraceCapture::contains(const std::string& text) const { return count(text) != 0; }

size_t TraceCapture::count(const std::string& text) const {
    size_t n = 0;
    for (const auto& m : messages())
        if (m.text.find(text) != std::string::npos) ++n;
    return n;
}

std::string TraceCapture::dump() const {
    std::string all;
    for (const auto& m : messages()) {
        all += m.text;
        if (all.empty() || all.back() != '\n') all += '\n';
    }
    return all;
}

std::string runCommand(const std::string& command, int* status) {
    std::string out;
    FILE* p = popen(command.c_str(), "r");
    if (p == nullptr) {
        if (status != nullptr) *status = -1;
        return out;
    }
    char buf[4096];
    size_t n;
    while ((n = fread(buf, 1, sizeof buf, p)) > 0) out.append(buf, n);
    int rc = pclose(p);
    if (status != nullptr) *status = rc;
    return out;
}

namespace {

std::vector<std::string> emulatorWords() {
    std::vector<std::string> words;
    const char* emulator = std::getenv("FSCANNER_TEST_EMULATOR");
    if (emulator == nullptr) return words;
    std::string word;
    for (const char* c = emulator;; ++c) {
        if (*c == ' ' || *c == '\0') {
            if (!word.empty()) words.push_back(word);
            word.clear();
            if (*c == '\0') break;
        } else {
            word += *c;
        }
    }
    return words;
}

}  // namespace

void execBuildProgram(const std::vector<std::string>& argv) {
    std::vector<std::string> words = emulatorWords();
    words.insert(words.end(), argv.begin(), argv.end());
    if (words.empty()) return;
    std::vector<char*> raw;
    for (std::string& w : words) raw.push_back(const_cast<char*>(w.c_str()));
    raw.push_back(nullptr);
    if (words.size() > argv.size())
        execvp(raw[0], raw.data());
    else
        execv(raw[0], raw.data());
}

std::string emulatorPrefix() {
    std::string prefix;
    for (const std::string& w : emulatorWords()) prefix += w + " ";
    return prefix;
}

}  // namespace testsupport
