#include "base/KelCfg.h"

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <map>
#include <mutex>
#include <string>

namespace {

struct Store {
    std::mutex lock;
    bool loaded = false;
    std::map<std::string, std::string> keys;
    std::string error;
};

Store& store() {
    static Store s;
    return s;
}

std::string trim(const std::string& s) {
    const char* blanks = " \t\r\n\v\f";
    size_t b = s.find_first_not_of(blanks);
    if (b == std::string::npos) return std::string();
    size_t e = s.find_last_not_of(blanks);
    return s.substr(b, e - b + 1);
}

// Reads path into s; the caller holds the lock.
bool loadLocked(Store& s, const char* path) {
    s.keys.clear();
    s.error.clear();
    s.loaded = true;
    if (path == nullptr || *path == '\0') {
        s.error = "no configuration file given";
        return false;
    }
    std::ifstream in(path);
    if (!in) {
        s.error = std::string("cannot read configuration file '") + path + "': " + std::strerror(errno);
        return false;
    }
    std::string line;
    unsigned lineNo = 0;
    while (std::getline(in, line)) {
        ++lineNo;
        std::string t = trim(line);
        if (t.empty() || t[0] == '#') continue;
        size_t eq = t.find('=');
        std::string key = eq == std::string::npos ? std::string() : trim(t.substr(0, eq));
        if (eq == std::string::npos || key.empty()) {
            if (s.error.empty())
                s.error = std::string("configuration file '") + path + "' line " +
                          std::to_string(lineNo) + ": expected key=value";
            continue;
        }
        s.keys[key] = trim(t.substr(eq + 1));
    }
    return true;
}

void ensureLoaded(Store& s) {
    if (s.loaded) return;
    const char* path = std::getenv("FSCANNER_CONFIG");
    if (path == nullptr) {
        s.loaded = true;
        s.error = "FSCANNER_CONFIG is not set";
        return;
    }
    loadLocked(s, path);
}

}  // namespace

String KelCfg::getKey(const String& key) {
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    ensureLoaded(s);
    auto it = s.keys.find(static_cast<const char*>(key));
    return it == s.keys.end() ? String("") : String(it->second.c_str());
}

String KelCfg::getError() {
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    ensureLoaded(s);
    return String(s.error.c_str());
}

void KelCfg::setKey(const char* key, const char* value) {
    if (key == nullptr) return;
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    ensureLoaded(s);
    s.keys[key] = value != nullptr ? value : "";
}

void KelCfg::removeKey(const char* key) {
    if (key == nullptr) return;
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    ensureLoaded(s);
    s.keys.erase(key);
}

void KelCfg::clear() {
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    s.keys.clear();
    s.error.clear();
    s.loaded = true;
}

bool KelCfg::loadFile(const char* path) {
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    return loadLocked(s, path);
}

void KelCfg::reset() {
    Store& s = store();
    std::lock_guard<std::mutex> g(s.lock);
    s.keys.clear();
    s.error.clear();
    s.loaded = false;
}
