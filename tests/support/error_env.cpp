#include "support/error_env.h"

#include <sys/mman.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstring>

namespace testsupport {

ErrorEnv::ErrorEnv(fscanner::Env* target)
    : EnvWrapper(target),
      counts_(static_cast<size_t>(EnvCall::Count), 0),
      injected_(0),
      diskLimited_(false),
      budget_(-1),
      chargesInFull_(false),
      refusals_(0) {}

void ErrorEnv::failNth(EnvCall kind, int nth, int error) {
    std::lock_guard<std::mutex> guard(lock_);
    nthRules_.push_back(NthRule{kind, nth, error});
}

void ErrorEnv::failPath(EnvCall kind, const std::string& pattern, int error) {
    std::lock_guard<std::mutex> guard(lock_);
    pathRules_.push_back(PathRule{kind, pattern, error});
}

void ErrorEnv::actAt(EnvCall kind, const std::string& pattern, int nth, std::function<void()> action) {
    std::lock_guard<std::mutex> guard(lock_);
    actionRules_.push_back(ActionRule{kind, pattern, nth, std::move(action)});
}

void ErrorEnv::clearRules() {
    std::lock_guard<std::mutex> guard(lock_);
    nthRules_.clear();
    pathRules_.clear();
    actionRules_.clear();
}

void ErrorEnv::limitSpaceFor(const std::string& pattern) {
    std::lock_guard<std::mutex> guard(lock_);
    diskPattern_ = pattern;
    diskLimited_ = true;
    budget_ = -1;
    refusals_ = 0;
    reservedEnd_.clear();
}

int ErrorEnv::calls(EnvCall kind) const {
    std::lock_guard<std::mutex> guard(lock_);
    if (kind != EnvCall::Any) return counts_[static_cast<size_t>(kind)];
    int sum = 0;
    for (int n : counts_) sum += n;
    return sum;
}

int ErrorEnv::injected() const {
    std::lock_guard<std::mutex> guard(lock_);
    return injected_;
}

void ErrorEnv::resetCounts() {
    std::lock_guard<std::mutex> guard(lock_);
    std::fill(counts_.begin(), counts_.end(), 0);
    injected_ = 0;
}

int ErrorEnv::enter(EnvCall kind, const std::string& path) {
    std::vector<std::function<void()>> due;
    int error = 0;
    {
        std::lock_guard<std::mutex> guard(lock_);
        ++counts_[static_cast<size_t>(kind)];
        for (ActionRule& rule : actionRules_) {
            if (rule.remaining <= 0) continue;
            if (rule.kind != EnvCall::Any && rule.kind != kind) continue;
            if (!rule.pattern.empty() && path.find(rule.pattern) == std::string::npos) continue;
            if (--rule.remaining == 0) due.push_back(rule.action);
        }
        for (NthRule& rule : nthRules_) {
            if (rule.remaining <= 0 || (rule.kind != EnvCall::Any && rule.kind != kind)) continue;
            if (--rule.remaining == 0 && error == 0) error = rule.error;
        }
        for (const PathRule& rule : pathRules_) {
            if (error != 0) break;
            if (rule.kind != EnvCall::Any && rule.kind != kind) continue;
            if (!path.empty() && path.find(rule.pattern) != std::string::npos) error = rule.error;
        }
        if (error != 0) ++injected_;
    }
    for (auto& action : due) action();
    return error;
}

std::string ErrorEnv::pathOf(int fd) {
    std::lock_guard<std::mutex> guard(lock_);
    auto it = paths_.find(fd);
    return it != paths_.end() ? it->second : std::string();
}

void ErrorEnv::remember(int fd, const char* path) {
    if (fd < 0) return;
    std::lock_guard<std::mutex> guard(lock_);
    paths_[fd] = path != nullptr ? path : "";
}

namespace {
std::string text(const char* path) { return path != nullptr ? path : std::string(); }
}  // namespace

// Each call: count it and apply the rules; an injected error gives the
// failure value of the call with errno set.
#define ERROR_ENV_ENTER(kind, path, failure)  \
    do {                                      \
        int injected = enter(kind, path);     \
        if (injected != 0) {                  \
            errno = injected;                 \
            return failure;                   \
        }                                     \
    } while (0)

int ErrorEnv::openFile(const char* path, int flags, mode_t mode) {
    ERROR_ENV_ENTER(EnvCall::OpenFile, text(path), -1);
    int fd = EnvWrapper::openFile(path, flags, mode);
    remember(fd, path);
    return fd;
}

int ErrorEnv::openFileAt(int directoryFd, const char* name, int flags, mode_t mode) {
    ERROR_ENV_ENTER(EnvCall::OpenFile, text(name), -1);
    int fd = EnvWrapper::openFileAt(directoryFd, name, flags, mode);
    remember(fd, name);
    return fd;
}

int ErrorEnv::closeFile(int fd) {
    std::string path = pathOf(fd);
    {
        std::lock_guard<std::mutex> guard(lock_);
        paths_.erase(fd);
    }
    ERROR_ENV_ENTER(EnvCall::CloseFile, path, -1);
    return EnvWrapper::closeFile(fd);
}

ssize_t ErrorEnv::readFile(int fd, void* buffer, size_t count) {
    ERROR_ENV_ENTER(EnvCall::ReadFile, pathOf(fd), -1);
    return EnvWrapper::readFile(fd, buffer, count);
}

ssize_t ErrorEnv::readFileAt(int fd, void* buffer, size_t count, off_t offset) {
    ERROR_ENV_ENTER(EnvCall::ReadFile, pathOf(fd), -1);
    return EnvWrapper::readFileAt(fd, buffer, count, offset);
}

ssize_t ErrorEnv::writeFile(int fd, const void* buffer, size_t count) {
    ERROR_ENV_ENTER(EnvCall::WriteFile, pathOf(fd), -1);
    return EnvWrapper::writeFile(fd, buffer, count);
}

ssize_t ErrorEnv::writeFileAt(int fd, const void* buffer, size_t count, off_t offset) {
    ERROR_ENV_ENTER(EnvCall::WriteFile, pathOf(fd), -1);
    return EnvWrapper::writeFileAt(fd, buffer, count, offset);
}

int ErrorEnv::truncateFile(int fd, off_t length) {
    ERROR_ENV_ENTER(EnvCall::TruncateFile, pathOf(fd), -1);
    return EnvWrapper::truncateFile(fd, length);
}

int ErrorEnv::syncFile(int fd) {
    ERROR_ENV_ENTER(EnvCall::SyncFile, pathOf(fd), -1);
    return EnvWrapper::syncFile(fd);
}

int ErrorEnv::reserveSpace(const char* name, int fd, off_t offset, off_t length) {
    // The reservation reports its error as its result, errno untouched.
    std::string path = name != nullptr ? std::string(name) : pathOf(fd);
    int injected = enter(EnvCall::ReserveSpace, path);
    if (injected != 0) return injected;
    if (diskLimited_ && path.find(diskPattern_) != std::string::npos) {
        unsigned long long from = static_cast<unsigned long long>(offset);
        unsigned long long end = from + static_cast<unsigned long long>(length);
        unsigned long long charge = static_cast<unsigned long long>(length);
        std::pair<dev_t, ino_t> key(0, 0);
        struct stat st;
        std::lock_guard<std::mutex> guard(lock_);
        if (!chargesInFull_ && ::fstat(fd, &st) == 0) {
            key = std::make_pair(st.st_dev, st.st_ino);
            if (st.st_size == 0) reservedEnd_.erase(key);  // a file made anew
            unsigned long long had = reservedEnd_.count(key) != 0 ? reservedEnd_[key] : 0;
            charge = end <= had ? 0 : end - (from > had ? from : had);
        }
        if (budget_ >= 0) {
            if (static_cast<long long>(charge) > budget_) {
                ++refusals_;
                ++injected_;
                return ENOSPC;
            }
            budget_ -= static_cast<long long>(charge);
        }
        if (!chargesInFull_ && (reservedEnd_.count(key) == 0 || reservedEnd_[key] < end)) reservedEnd_[key] = end;
    }
    return EnvWrapper::reserveSpace(name, fd, offset, length);
}

void* ErrorEnv::mapFile(void* address, size_t length, int protection, int flags, int fd, off_t offset) {
    ERROR_ENV_ENTER(EnvCall::MapFile, pathOf(fd), MAP_FAILED);
    return EnvWrapper::mapFile(address, length, protection, flags, fd, offset);
}

int ErrorEnv::unmapFile(void* address, size_t length) {
    ERROR_ENV_ENTER(EnvCall::UnmapFile, std::string(), -1);
    return EnvWrapper::unmapFile(address, length);
}

int ErrorEnv::syncMapping(void* address, size_t length, int flags) {
    ERROR_ENV_ENTER(EnvCall::SyncMapping, std::string(), -1);
    return EnvWrapper::syncMapping(address, length, flags);
}

int ErrorEnv::lockRange(int fd, int command, off_t length) {
    ERROR_ENV_ENTER(EnvCall::Lock, pathOf(fd), -1);
    return EnvWrapper::lockRange(fd, command, length);
}

int ErrorEnv::lockFile(int fd, int operation) {
    ERROR_ENV_ENTER(EnvCall::Lock, pathOf(fd), -1);
    return EnvWrapper::lockFile(fd, operation);
}

FILE* ErrorEnv::openStream(const char* path, const char* mode) {
    ERROR_ENV_ENTER(EnvCall::OpenStream, text(path), nullptr);
    return EnvWrapper::openStream(path, mode);
}

FILE* ErrorEnv::openStreamOnFd(int fd, const char* mode) {
    ERROR_ENV_ENTER(EnvCall::OpenStream, pathOf(fd), nullptr);
    FILE* stream = EnvWrapper::openStreamOnFd(fd, mode);
    if (stream != nullptr) {
        // The stream owns the descriptor now; fclose ends it unseen.
        std::lock_guard<std::mutex> guard(lock_);
        paths_.erase(fd);
    }
    return stream;
}

int ErrorEnv::closeStream(FILE* stream) {
    ERROR_ENV_ENTER(EnvCall::CloseStream, std::string(), EOF);
    return EnvWrapper::closeStream(stream);
}

int ErrorEnv::removeFile(const char* path) {
    ERROR_ENV_ENTER(EnvCall::RemoveFile, text(path), -1);
    return EnvWrapper::removeFile(path);
}

int ErrorEnv::renameFile(const char* from, const char* to) {
    ERROR_ENV_ENTER(EnvCall::RenameFile, text(from) + " -> " + text(to), -1);
    return EnvWrapper::renameFile(from, to);
}

int ErrorEnv::makeDirectory(const char* path, mode_t mode) {
    ERROR_ENV_ENTER(EnvCall::MakeDirectory, text(path), -1);
    return EnvWrapper::makeDirectory(path, mode);
}

int ErrorEnv::checkAccess(const char* path, int mode) {
    ERROR_ENV_ENTER(EnvCall::CheckAccess, text(path), -1);
    return EnvWrapper::checkAccess(path, mode);
}

int ErrorEnv::makeTempFile(char* pathTemplate, int suffixLength) {
    ERROR_ENV_ENTER(EnvCall::MakeTempFile, text(pathTemplate), -1);
    int fd = EnvWrapper::makeTempFile(pathTemplate, suffixLength);
    remember(fd, pathTemplate);
    return fd;
}

DIR* ErrorEnv::openDirectory(const char* path) {
    ERROR_ENV_ENTER(EnvCall::OpenDirectory, text(path), nullptr);
    return EnvWrapper::openDirectory(path);
}

struct dirent* ErrorEnv::readDirectory(DIR* directory) {
    ERROR_ENV_ENTER(EnvCall::ReadDirectory, std::string(), nullptr);
    return EnvWrapper::readDirectory(directory);
}

int ErrorEnv::closeDirectory(DIR* directory) {
    ERROR_ENV_ENTER(EnvCall::CloseDirectory, std::string(), -1);
    return EnvWrapper::closeDirectory(directory);
}

int ErrorEnv::status(const char* path, struct stat* result) {
    ERROR_ENV_ENTER(EnvCall::Status, text(path), -1);
    return EnvWrapper::status(path, result);
}

int ErrorEnv::linkStatus(const char* path, struct stat* result) {
    ERROR_ENV_ENTER(EnvCall::LinkStatus, text(path), -1);
    return EnvWrapper::linkStatus(path, result);
}

int ErrorEnv::fileStatus(int fd, struct stat* result) {
    ERROR_ENV_ENTER(EnvCall::FileStatus, pathOf(fd), -1);
    return EnvWrapper::fileStatus(fd, result);
}

ssize_t ErrorEnv::readLink(const char* path, char* buffer, size_t size) {
    ERROR_ENV_ENTER(EnvCall::ReadLink, text(path), -1);
    return EnvWrapper::readLink(path, buffer, size);
}

char* ErrorEnv::resolvePath(const char* path, char* resolved) {
    ERROR_ENV_ENTER(EnvCall::ResolvePath, text(path), nullptr);
    return EnvWrapper::resolvePath(path, resolved);
}

char* ErrorEnv::currentDirectory(char* buffer, size_t size) {
    ERROR_ENV_ENTER(EnvCall::CurrentDirectory, std::string(), nullptr);
    return EnvWrapper::currentDirectory(buffer, size);
}

FILE* ErrorEnv::openPipe(const char* command, const char* mode) {
    ERROR_ENV_ENTER(EnvCall::OpenPipe, text(command), nullptr);
    return EnvWrapper::openPipe(command, mode);
}

int ErrorEnv::closePipe(FILE* pipe) {
    ERROR_ENV_ENTER(EnvCall::ClosePipe, std::string(), -1);
    return EnvWrapper::closePipe(pipe);
}

void* ErrorEnv::loadLibrary(const char* name, int flags) {
    int injected = enter(EnvCall::LoadLibrary, text(name));
    if (injected != 0) {
        // dlopen reports through dlerror, not errno.
        std::lock_guard<std::mutex> guard(lock_);
        libraryError_ = text(name) + ": " + std::strerror(injected);
        errno = injected;
        return nullptr;
    }
    return EnvWrapper::loadLibrary(name, flags);
}

void* ErrorEnv::findSymbol(void* library, const char* symbol) {
    ERROR_ENV_ENTER(EnvCall::FindSymbol, text(symbol), nullptr);
    return EnvWrapper::findSymbol(library, symbol);
}

int ErrorEnv::unloadLibrary(void* library) {
    ERROR_ENV_ENTER(EnvCall::UnloadLibrary, std::string(), -1);
    return EnvWrapper::unloadLibrary(library);
}

const char* ErrorEnv::libraryError() {
    {
        std::lock_guard<std::mutex> guard(lock_);
        if (!libraryError_.empty()) {
            // As dlerror: the message once, then null until the next failure.
            static thread_local std::string shown;
            shown.swap(libraryError_);
            libraryError_.clear();
            return shown.c_str();
        }
    }
    return EnvWrapper::libraryError();
}

int ErrorEnv::fileControl(int fd, int command, long argument) {
    ERROR_ENV_ENTER(EnvCall::FileControl, pathOf(fd), -1);
    return EnvWrapper::fileControl(fd, command, argument);
}

int ErrorEnv::deviceControl(int fd, unsigned long request, void* argument) {
    ERROR_ENV_ENTER(EnvCall::DeviceControl, pathOf(fd), -1);
    return EnvWrapper::deviceControl(fd, request, argument);
}

int ErrorEnv::removeDirectory(const char* path) {
    ERROR_ENV_ENTER(EnvCall::RemoveDirectory, text(path), -1);
    return EnvWrapper::removeDirectory(path);
}

char* ErrorEnv::tempName(char* buffer) {
    ERROR_ENV_ENTER(EnvCall::TempName, std::string(), nullptr);
    return EnvWrapper::tempName(buffer);
}

#undef ERROR_ENV_ENTER

}  // namespace testsupport
