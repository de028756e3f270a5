// The POSIX Env: each call is the system call it is named after.
#include <dlfcn.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/mman.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>

#include "fscanner/fscommon/env.h"

namespace fscanner {
namespace {

class PosixEnv : public Env {
public:
    int openFile(const char* path, int flags, mode_t mode) override { return ::open(path, flags, mode); }
    int openFileAt(int directoryFd, const char* name, int flags, mode_t mode) override {
        return ::openat(directoryFd, name, flags, mode);
    }
    int closeFile(int fd) override { return ::close(fd); }
    ssize_t readFile(int fd, void* buffer, size_t count) override { return ::read(fd, buffer, count); }
    ssize_t readFileAt(int fd, void* buffer, size_t count, off_t offset) override {
        return ::pread(fd, buffer, count, offset);
    }
    ssize_t writeFile(int fd, const void* buffer, size_t count) override { return ::write(fd, buffer, count); }
    ssize_t writeFileAt(int fd, const void* buffer, size_t count, off_t offset) override {
        return ::pwrite(fd, buffer, count, offset);
    }
    int truncateFile(int fd, off_t length) override { return ::ftruncate(fd, length); }
    int syncFile(int fd) override { return ::fsync(fd); }
    int reserveSpace(const char*, int fd, off_t offset, off_t length) override {
        return ::posix_fallocate(fd, offset, length);
    }
    void* mapFile(void* address, size_t length, int protection, int flags, int fd, off_t offset) override {
        return ::mmap(address, length, protection, flags, fd, offset);
    }
    int unmapFile(void* address, size_t length) override { return ::munmap(address, length); }
    int syncMapping(void* address, size_t length, int flags) override { return ::msync(address, length, flags); }
    int lockRange(int fd, int command, off_t length) override { return ::lockf(fd, command, length); }
    int lockFile(int fd, int operation) override { return ::flock(fd, operation); }
    FILE* openStream(const char* path, const char* mode) override { return std::fopen(path, mode); }
    FILE* openStreamOnFd(int fd, const char* mode) override { return ::fdopen(fd, mode); }
    int closeStream(FILE* stream) override { return std::fclose(stream); }
    int removeFile(const char* path) override { return ::unlink(path); }
    int renameFile(const char* from, const char* to) override { return ::rename(from, to); }
    int makeDirectory(const char* path, mode_t mode) override { return ::mkdir(path, mode); }
    int checkAccess(const char* path, int mode) override { return ::access(path, mode); }
    int makeTempFile(char* pathTemplate, int suffixLength) override {
        return ::mkstemps(pathTemplate, suffixLength);
    }
    DIR* openDirectory(const char* path) override { return ::opendir(path); }
    DIR* openDirectoryOnFd(int fd) override { return ::fdopendir(fd); }
    struct dirent* readDirectory(DIR* directory) override { return ::readdir(directory); }
    int closeDirectory(DIR* directory) override { return ::closedir(directory); }
    int directoryFd(DIR* directory) override { return ::dirfd(directory); }
    int status(const char* path, struct stat* result) override { return ::stat(path, result); }
    int linkStatus(const char* path, struct stat* result) override { return ::lstat(path, result); }
    int fileStatus(int fd, struct stat* result) override { return ::fstat(fd, result); }
    int statusAt(int directoryFd, const char* name, struct stat* result, int flags) override {
        return ::fstatat(directoryFd, name, result, flags);
    }
    ssize_t readLink(const char* path, char* buffer, size_t size) override {
        return ::readlink(path, buffer, size);
    }
    char* resolvePath(const char* path, char* resolved) override { return ::realpath(path, resolved); }
    char* currentDirectory(char* buffer, size_t size) override { return ::getcwd(buffer, size); }
    FILE* openPipe(const char* command, const char* mode) override { return ::popen(command, mode); }
    int closePipe(FILE* pipe) override { return ::pclose(pipe); }
    void* loadLibrary(const char* name, int flags) override { return ::dlopen(name, flags); }
    void* findSymbol(void* library, const char* symbol) override { return ::dlsym(library, symbol); }
    int unloadLibrary(void* library) override { return ::dlclose(library); }
    const char* libraryError() override { return ::dlerror(); }
    int fileControl(int fd, int command, long argument) override { return ::fcntl(fd, command, argument); }
    int deviceControl(int fd, unsigned long request, void* argument) override {
        return ::ioctl(fd, request, argument);
    }
    int removeDirectory(const char* path) override { return ::rmdir(path); }
    char* tempName(char* buffer) override {
        // Result files take their first name from here: a name only,
        // nothing is created until the writer makes the file.
        return std::tmpnam(buffer);
    }
    ssize_t readDirectoryEntries(int fd, void* buffer, size_t size) override {
        return ::syscall(SYS_getdents64, fd, buffer, size);
    }
};

std::atomic<Env*> installed{nullptr};

}  // namespace

Env* Env::Default() {
    // Never destroyed: library calls may run from static destructors and
    // cleanup handlers at exit.
    static PosixEnv* posix = new PosixEnv;
    return posix;
}

Env* Env::Current() {
    Env* env = installed.load(std::memory_order_acquire);
    return env != nullptr ? env : Default();
}

Env* Env::Install(Env* env) {
    Env* before = installed.exchange(env, std::memory_order_acq_rel);
    return before != nullptr ? before : Default();
}

bool ReadFileToString(Env* env, const char* path, std::string* content) {
    content->clear();
    int fd;
    do {
        fd = env->openFile(path, O_RDONLY | O_CLOEXEC);
    } while (fd == -1 && errno == EINTR);
    if (fd == -1) return false;
    char buffer[8192];
    bool ok = true;
    for (;;) {
        ssize_t n = env->readFile(fd, buffer, sizeof buffer);
        if (n < 0 && errno == EINTR) continue;
        if (n < 0) {
            ok = false;
            break;
        }
        if (n == 0) break;
        content->append(buffer, static_cast<size_t>(n));
    }
    int error = errno;
    env->closeFile(fd);
    if (!ok) errno = error;
    return ok;
}

bool WriteFully(Env* env, int fd, const void* data, size_t length) {
    const char* bytes = static_cast<const char*>(data);
    while (length > 0) {
        ssize_t n = env->writeFile(fd, bytes, length);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) {
            if (n == 0) errno = ENOSPC;
            return false;
        }
        bytes += n;
        length -= static_cast<size_t>(n);
    }
    return true;
}

}  // namespace fscanner
