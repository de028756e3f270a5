// A fault-injecting Env for tests: forwards every call to the real one and
// changes the few a test is about.  It can fail the Nth call of a kind, fail
// the calls on paths that hold a pattern with a given errno, play a disk
// that fills up (posix_fallocate answering ENOSPC past a budget), run an
// action at a chosen call (to kill a process at a crash point), and count
// every call by kind.
//
// Descriptor calls (write, truncate, sync, reservation, close) are matched
// against the path the descriptor was opened with through this Env.
//
// Install it with ScopedEnv for the span of a test; the library then sees it
// in every unit at once.  Not for use from two threads at once beyond
// counting: the rules are set up before the calls they govern.
#ifndef FSCANNER_TESTS_SUPPORT_ERROR_ENV_H
#define FSCANNER_TESTS_SUPPORT_ERROR_ENV_H

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "fscanner/fscommon/env.h"

namespace testsupport {

// The kinds of call, one per Env operation.
enum class EnvCall {
    Any,
    OpenFile,
    CloseFile,
    ReadFile,
    WriteFile,
    TruncateFile,
    SyncFile,
    ReserveSpace,
    MapFile,
    UnmapFile,
    SyncMapping,
    Lock,
    OpenStream,
    CloseStream,
    RemoveFile,
    RenameFile,
    MakeDirectory,
    CheckAccess,
    MakeTempFile,
    OpenDirectory,
    ReadDirectory,
    CloseDirectory,
    Status,
    LinkStatus,
    FileStatus,
    ReadLink,
    ResolvePath,
    CurrentDirectory,
    OpenPipe,
    ClosePipe,
    LoadLibrary,
    FindSymbol,
    UnloadLibrary,
    FileControl,
    DeviceControl,
    RemoveDirectory,
    TempName,
    Count
};

class ErrorEnv : public fscanner::EnvWrapper {
public:
    // Forwards to target, by default the POSIX Env.
    explicit ErrorEnv(fscanner::Env* target = fscanner::Env::Default());

    // The nth call of kind (1 = the next one) from now on fails with error.
    void failNth(EnvCall kind, int nth, int error);
    // Every call of kind whose path holds pattern fails with error, until
    // clearRules().  kind Any takes every call that has a path.
    void failPath(EnvCall kind, const std::string& pattern, int error);
    // Runs action before the nth call of kind whose path holds pattern
    // (empty: any path), counted from now.  The call then goes on as usual
    // (if the action returns).
    void actAt(EnvCall kind, const std::string& pattern, int nth, std::function<void()> action);
    // Forgets every failure and action rule (the disk and the counts stay).
    void clearRules();

    // The filling disk: reservations for files whose path holds pattern
    // draw on a budget of free bytes; a request the budget cannot cover is
    // refused with ENOSPC.  Like ext4 and tmpfs, a file is charged only for
    // bytes it has not reserved before; with chargesInFull every request is
    // charged whole, as XFS does.  What is granted is reserved for real.
    void limitSpaceFor(const std::string& pattern);
    void fillAfter(long long bytes) { budget_ = bytes; }  // from now only bytes more fit
    void makeRoom() { budget_ = -1; }                    // no limit
    void chargeInFull(bool inFull) { chargesInFull_ = inFull; }
    long long spaceLeft() const { return budget_; }
    int refusals() const { return refusals_; }

    // Calls of kind since construction or resetCounts(); Any sums them all.
    int calls(EnvCall kind) const;
    // Calls that a rule of this object made fail.
    int injected() const;
    void resetCounts();

    // ---- the wrapped calls
    int openFile(const char* path, int flags, mode_t mode = 0) override;
    int openFileAt(int directoryFd, const char* name, int flags, mode_t mode = 0) override;
    int closeFile(int fd) override;
    ssize_t readFile(int fd, void* buffer, size_t count) override;
    ssize_t readFileAt(int fd, void* buffer, size_t count, off_t offset) override;
    ssize_t writeFile(int fd, const void* buffer, size_t count) override;
    ssize_t writeFileAt(int fd, const void* buffer, size_t count, off_t offset) override;
    int truncateFile(int fd, off_t length) override;
    int syncFile(int fd) override;
    int reserveSpace(const char* name, int fd, off_t offset, off_t length) override;
    void* mapFile(void* address, size_t length, int protection, int flags, int fd, off_t offset) override;
    int unmapFile(void* address, size_t length) override;
    int syncMapping(void* address, size_t length, int flags) override;
    int lockRange(int fd, int command, off_t length) override;
    int lockFile(int fd, int operation) override;
    FILE* openStream(const char* path, const char* mode) override;
    FILE* openStreamOnFd(int fd, const char* mode) override;
    int closeStream(FILE* stream) override;
    int removeFile(const char* path) override;
    int renameFile(const char* from, const char* to) override;
    int makeDirectory(const char* path, mode_t mode) override;
    int checkAccess(const char* path, int mode) override;
    int makeTempFile(char* pathTemplate, int suffixLength) override;
    DIR* openDirectory(const char* path) override;
    struct dirent* readDirectory(DIR* directory) override;
    int closeDirectory(DIR* directory) override;
    int status(const char* path, struct stat* result) override;
    int linkStatus(const char* path, struct stat* result) override;
    int fileStatus(int fd, struct stat* result) override;
    ssize_t readLink(const char* path, char* buffer, size_t size) override;
    char* resolvePath(const char* path, char* resolved) override;
    char* currentDirectory(char* buffer, size_t size) override;
    FILE* openPipe(const char* command, const char* mode) override;
    int closePipe(FILE* pipe) override;
    void* loadLibrary(const char* name, int flags) override;
    void* findSymbol(void* library, const char* symbol) override;
    int unloadLibrary(void* library) override;
    const char* libraryError() override;
    int fileControl(int fd, int command, long argument) override;
    int deviceControl(int fd, unsigned long request, void* argument) override;
    int removeDirectory(const char* path) override;
    char* tempName(char* buffer) override;

private:
    struct NthRule {
        EnvCall kind;
        int remaining;
        int error;
    };
    struct PathRule {
        EnvCall kind;
        std::string pattern;
        int error;
    };
    struct ActionRule {
        EnvCall kind;
        std::string pattern;
        int remaining;
        std::function<void()> action;
    };

    // Counts the call, runs the actions it reaches, and returns the error
    // number a rule gives it (0: forward it).
    int enter(EnvCall kind, const std::string& path);
    std::string pathOf(int fd);
    void remember(int fd, const char* path);

    mutable std::mutex lock_;
    std::vector<int> counts_;
    int injected_;
    std::vector<NthRule> nthRules_;
    std::vector<PathRule> pathRules_;
    std::vector<ActionRule> actionRules_;
    std::map<int, std::string> paths_;  // descriptors opened through this Env
    std::string diskPattern_;
    bool diskLimited_;
    long long budget_;
    bool chargesInFull_;
    int refusals_;
    std::map<std::pair<dev_t, ino_t>, unsigned long long> reservedEnd_;
    std::string libraryError_;
};

// Installs an Env for its lifetime and puts back the one before.
class ScopedEnv {
public:
    explicit ScopedEnv(fscanner::Env* env) : before_(fscanner::Env::Install(env)) {}
    ~ScopedEnv() { fscanner::Env::Install(before_ == fscanner::Env::Default() ? nullptr : before_); }
    ScopedEnv(const ScopedEnv&) = delete;
    ScopedEnv& operator=(const ScopedEnv&) = delete;

private:
    fscanner::Env* before_;
};

}  // namespace testsupport

#endif
