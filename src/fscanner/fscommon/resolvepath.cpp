// The absolute form of a path, settled from its text (and, when asked, its
// symbolic links).  It sits below the path module so that the table store,
// which names its files by absolute directory, does not depend on drives and
// the query resolver.
#include "fscanner/fscommon/resolvepath.h"

#include <errno.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"

namespace {

// Buffers of the path flow: 4096 characters, a path being at most 4095.
const size_t PATH_BUFFER = 4096;
const int MAX_SYMBOLIC_LINKS = 32;

// kelm_malloc wide copy of a narrow text; null when it can't be converted.
wchar_t* narrowToWide(const char* text) {
    size_t length = mbstowcs(nullptr, text, 0);
    if (length == static_cast<size_t>(-1)) return nullptr;
    wchar_t* wide = static_cast<wchar_t*>(kelm_malloc((length + 1) * sizeof(wchar_t)));
    if (!wide) return nullptr;
    mbstowcs(wide, text, length + 1);
    wide[length] = L'\0';
    return wide;
}

// kelm_malloc narrow copy of a wide text; null when it can't be converted.
char* wideToNarrow(const wchar_t* text) {
    size_t length = wcstombs(nullptr, text, 0);
    if (length == static_cast<size_t>(-1)) return nullptr;
    char* narrow = static_cast<char*>(kelm_malloc(length + 1));
    if (!narrow) return nullptr;
    wcstombs(narrow, text, length + 1);
    narrow[length] = '\0';
    return narrow;
}

// Removes the last component of an output that ends in "/", never passing
// the root: "/a/b/" gives "/a/".
void dropLastComponent(std::string& resolved) {
    if (resolved.size() <= 1) return;
    resolved.erase(resolved.size() - 1);
    size_t slash = resolved.rfind('/');
    resolved.erase(slash == std::string::npos ? 0 : slash + 1);
    if (resolved.empty()) resolved = "/";
}

// The lexical walk of realPath on the narrow form.  False on any failure.
bool resolveNarrow(const char* path, bool followLinks, std::string& resolved) {
    if (strlen(path) >= PATH_BUFFER) return false;
    if (path[0] == '/') {
        resolved = "/";
    } else {
        char cwd[PATH_BUFFER];
        if (fscanner::Env::Current()->currentDirectory(cwd, PATH_BUFFER - 1) == nullptr) return false;
        resolved = cwd;
        if (resolved.empty() || resolved[resolved.size() - 1] != '/') resolved += '/';
    }
    std::string left(path);
    int links = 0;
    while (!left.empty()) {
        size_t slash = left.find('/');
        std::string component = left.substr(0, slash);
        left = slash == std::string::npos ? std::string() : left.substr(slash + 1);
        if (resolved[resolved.size() - 1] != '/') resolved += '/';
        if (component.empty() || component == ".") continue;
        if (component == "..") {
            dropLastComponent(resolved);
            continue;
        }
        resolved += component;
        if (resolved.size() >= PATH_BUFFER) return false;
        if (!followLinks) continue;

        char target[PATH_BUFFER];
        ssize_t length = fscanner::Env::Current()->readLink(resolved.c_str(), target, sizeof(target) - 1);
        if (length < 0) {
            if (errno == EINVAL) continue;  // not a link: the walk goes on
            return false;
        }
        if (++links > MAX_SYMBOLIC_LINKS) return false;
        target[length] = '\0';
        if (target[0] == '/') {
            resolved = "/";
        } else {
            resolved += '/';
            dropLastComponent(resolved);
        }
        std::string next(target);
        if (!left.empty()) {
            next += '/';
            next += left;
        }
        if (next.size() >= PATH_BUFFER) return false;
        left = next;
    }
    if (resolved.size() > 1 && resolved[resolved.size() - 1] == '/') resolved.erase(resolved.size() - 1);
    return resolved.size() < PATH_BUFFER;
}

}  // namespace

wchar_t* resolvePath(const wchar_t* path, bool followLinks) {
    if (!path) return nullptr;
    char* narrow = wideToNarrow(path);
    if (!narrow) return nullptr;
    std::string resolved;
    bool done = resolveNarrow(narrow, followLinks, resolved);
    kelm_free(narrow);
    if (!done) return nullptr;
    return narrowToWide(resolved.c_str());
}

char* resolvePath(const char* path, bool followLinks) {
    if (!path) return nullptr;
    wchar_t* wide = narrowToWide(path);
    if (!wide) return nullptr;
    wchar_t* resolved = resolvePath(wide, followLinks);
    kelm_free(wide);
    if (!resolved) return nullptr;
    char* narrow = wideToNarrow(resolved);
    kelm_free(resolved);
    return narrow;
}
