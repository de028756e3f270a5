// Helpers shared by the test suites: temporary directories and trace capture.
#ifndef FSCANNER_TESTS_SUPPORT_TESTSUPPORT_H
#define FSCANNER_TESTS_SUPPORT_TESTSUPPORT_H

#include <cstddef>
#include <string>
#include <vector>

#include "base/QvLogWrapper.h"

namespace testsupport {

// A fresh directory under $TMPDIR (or /tmp), removed with all its contents when
// the object goes out of scope.
class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& path() const { return path_; }
    // path() + "/" + relative
    std::string file(const std::string& relative) const;
    // Writes content to relative (creating parent directories); returns the full path.
    std::string write(const std::string& relative, const std::string& content) const;
    // Creates the directory relative with its parents; returns the full path.
    std::string mkdirs(const std::string& relative) const;

private:
    std::string path_;
};

// Reads a whole file; empty when it cannot be read.
std::string readFile(const std::string& path);
// Writes size bytes to path, replacing the file; false when any step fails.
bool writeBytes(const std::string& path, const void* data, size_t size);
// Characters below 256 as they are: fixture names are ASCII or Latin-1 bytes.
inline std::wstring widen(const std::string& s) { return std::wstring(s.begin(), s.end()); }
bool fileExists(const std::string& path);
// Removes a tree; permissions are restored first so unreadable fixtures go too.
void removeTree(const std::string& path);

// Points the lock files of the shared mutexes at a directory of its own
// while it lives, and puts the store that was set before back after.
class LockStore {
public:
    LockStore();
    ~LockStore();
    LockStore(const LockStore&) = delete;
    LockStore& operator=(const LockStore&) = delete;
    // False when the store could not be set (the path too long).
    bool ok() const { return ok_; }

private:
    TempDir dir_;
    std::string saved_;
    bool ok_ = false;
};

// Captures every trace message while it lives.
class TraceCapture {
public:
    explicit TraceCapture(int maxLevel = QvLogWrapper::LEVEL_MAX);
    ~TraceCapture();
    std::vector<QvLogWrapper::Message> messages() const;
    // True when some captured message contains text.
    bool contains(const std::string& text) const;
    // Number of captured messages that contain text.
    size_t count(const std::string& text) const;
    // All messages joined by newlines, for failure output.
    std::string dump() const;
};

// Runs a shell command and gives its standard output.
std::string runCommand(const std::string& command, int* status = nullptr);

// Replaces the calling process (a forked child) with a program of the build:
// argv[0] is the program's path.  When FSCANNER_TEST_EMULATOR names an
// emulator (for example "qemu-i386 -L /", set by CTest in a 32-bit build
// whose programs this machine cannot run itself), the program runs under it.
// Returns only when the exec failed.
void execBuildProgram(const std::vector<std::string>& argv);

// The prefix for a shell command that starts a program of the build: the
// emulator's words and a space, or "" when none is set.
std::string emulatorPrefix();

}  // namespace testsupport

#endif
