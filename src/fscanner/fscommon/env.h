// The library's one door to the operating system.
//
// Every call the library makes on files, directories, file status,
// temporary files, child processes and loadable libraries goes through the
// process's Env.  Env::Default() is the POSIX implementation; a host or a
// test replaces it in one place with Env::Install(), usually with an
// EnvWrapper subclass that forwards every call and changes the few it is
// about (fail the third write, report a full disk, count status calls).
//
// Calls keep the POSIX contract of the function they are named after:
// descriptors and streams as the system gives them, -1 (or null) with errno
// set on failure.  Paths are multibyte, as the system takes them.
//
// Threads: the installed Env is read without a lock; install it before the
// first query and leave it in place while any query runs.
#ifndef FSCANNER_FSCOMMON_ENV_H
#define FSCANNER_FSCOMMON_ENV_H

#include <dirent.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <cstdint>
#include <cstdio>
#include <string>

namespace fscanner {

class Env {
public:
    virtual ~Env() {}

    // The POSIX implementation; never null, never deleted.
    static Env* Default();
    // The Env every library call uses: the installed one, else Default().
    static Env* Current();
    // Installs env (not owned) for every later call; null restores
    // Default().  Returns the Env that was installed before.
    static Env* Install(Env* env);

    // ------------------------------------------------------------- files
    // open(2) and openat(2).
    virtual int openFile(const char* path, int flags, mode_t mode = 0) = 0;
    virtual int openFileAt(int directoryFd, const char* name, int flags, mode_t mode = 0) = 0;
    virtual int closeFile(int fd) = 0;
    // read(2), pread(2), write(2), pwrite(2).
    virtual ssize_t readFile(int fd, void* buffer, size_t count) = 0;
    virtual ssize_t readFileAt(int fd, void* buffer, size_t count, off_t offset) = 0;
    virtual ssize_t writeFile(int fd, const void* buffer, size_t count) = 0;
    virtual ssize_t writeFileAt(int fd, const void* buffer, size_t count, off_t offset) = 0;
    // ftruncate(2), fsync(2).
    virtual int truncateFile(int fd, off_t length) = 0;
    virtual int syncFile(int fd) = 0;
    // posix_fallocate(3): the error number, 0 on success (errno untouched).
    // name is the file's path, for wrappers that fail one file only.
    virtual int reserveSpace(const char* name, int fd, off_t offset, off_t length) = 0;
    // mmap(2), munmap(2), msync(2).
    virtual void* mapFile(void* address, size_t length, int protection, int flags, int fd,
                          off_t offset) = 0;
    virtual int unmapFile(void* address, size_t length) = 0;
    virtual int syncMapping(void* address, size_t length, int flags) = 0;
    // lockf(3) and flock(2).
    virtual int lockRange(int fd, int command, off_t length) = 0;
    virtual int lockFile(int fd, int operation) = 0;
    // fopen(3), fdopen(3), fclose(3).
    virtual FILE* openStream(const char* path, const char* mode) = 0;
    virtual FILE* openStreamOnFd(int fd, const char* mode) = 0;
    virtual int closeStream(FILE* stream) = 0;
    // unlink(2), rename(2), mkdir(2), access(2).
    virtual int removeFile(const char* path) = 0;
    virtual int renameFile(const char* from, const char* to) = 0;
    virtual int makeDirectory(const char* path, mode_t mode) = 0;
    virtual int checkAccess(const char* path, int mode) = 0;
    // mkstemps(3): replaces the six X before the last suffixLength bytes of
    // pathTemplate and creates the file exclusively; the open descriptor.
    virtual int makeTempFile(char* pathTemplate, int suffixLength) = 0;

    // -------------------------------------------------------- directories
    // opendir(3), fdopendir(3) (takes the descriptor), readdir(3),
    // closedir(3), dirfd(3).
    virtual DIR* openDirectory(const char* path) = 0;
    virtual DIR* openDirectoryOnFd(int fd) = 0;
    virtual struct dirent* readDirectory(DIR* directory) = 0;
    virtual int closeDirectory(DIR* directory) = 0;
    virtual int directoryFd(DIR* directory) = 0;

    // ------------------------------------------------------------- status
    // stat(2), lstat(2), fstat(2), fstatat(2), readlink(2), realpath(3),
    // getcwd(3).
    virtual int status(const char* path, struct stat* result) = 0;
    virtual int linkStatus(const char* path, struct stat* result) = 0;
    virtual int fileStatus(int fd, struct stat* result) = 0;
    virtual int statusAt(int directoryFd, const char* name, struct stat* result, int flags) = 0;
    virtual ssize_t readLink(const char* path, char* buffer, size_t size) = 0;
    virtual char* resolvePath(const char* path, char* resolved) = 0;
    virtual char* currentDirectory(char* buffer, size_t size) = 0;

    // ---------------------------------------------------------- processes
    // popen(3), pclose(3).
    virtual FILE* openPipe(const char* command, const char* mode) = 0;
    virtual int closePipe(FILE* pipe) = 0;

    // ---------------------------------------------------------- libraries
    // dlopen(3), dlsym(3), dlclose(3), dlerror(3).
    virtual void* loadLibrary(const char* name, int flags) = 0;
    virtual void* findSymbol(void* library, const char* symbol) = 0;
    virtual int unloadLibrary(void* library) = 0;
    virtual const char* libraryError() = 0;

    // ------------------------------------------------------- descriptors
    // fcntl(2) with an integer argument, ioctl(2) with a pointer argument.
    virtual int fileControl(int fd, int command, long argument) = 0;
    virtual int deviceControl(int fd, unsigned long request, void* argument) = 0;

    // rmdir(2).
    virtual int removeDirectory(const char* path) = 0;
    // tmpnam(3): proposes a name that no file has yet, creating nothing;
    // null when there is none.
    virtual char* tempName(char* buffer) = 0;

    // -------------------------------------------------------- directories
    // getdents64(2): fills buffer with the next records (struct dirent64
    // layout: 64-bit inode, 64-bit offset, 16-bit record length, type byte,
    // name) of the directory open on fd.  Bytes filled, 0 at the end, -1
    // with errno.  Reads a directory without the status and flag calls
    // fdopendir(3) makes.
    virtual ssize_t readDirectoryEntries(int fd, void* buffer, size_t size) = 0;
};

// Reads the whole of path (opened read-only) into *content, replacing what
// it held.  False, errno set, when the file cannot be opened or a read
// fails; *content then holds what was read before the failure.
bool ReadFileToString(Env* env, const char* path, std::string* content);

// Writes all length bytes at the descriptor's offset, again after a short
// write or an interrupted call.  False, errno set, when a write fails or
// writes nothing.
bool WriteFully(Env* env, int fd, const void* data, size_t length);

// Forwards every call to a target Env (not owned).  Subclass it and
// override the calls to change; the rest keep the target's behaviour.
class EnvWrapper : public Env {
public:
    explicit EnvWrapper(Env* target) : target_(target) {}
    Env* target() const { return target_; }

    int openFile(const char* path, int flags, mode_t mode = 0) override {
        return target_->openFile(path, flags, mode);
    }
    int openFileAt(int directoryFd, const char* name, int flags, mode_t mode = 0) override {
        return target_->openFileAt(directoryFd, name, flags, mode);
    }
    int closeFile(int fd) override { return target_->closeFile(fd); }
    ssize_t readFile(int fd, void* buffer, size_t count) override {
        return target_->readFile(fd, buffer, count);
    }
    ssize_t readFileAt(int fd, void* buffer, size_t count, off_t offset) override {
        return target_->readFileAt(fd, buffer, count, offset);
    }
    ssize_t writeFile(int fd, const void* buffer, size_t count) override {
        return target_->writeFile(fd, buffer, count);
    }
    ssize_t writeFileAt(int fd, const void* buffer, size_t count, off_t offset) override {
        return target_->writeFileAt(fd, buffer, count, offset);
    }
    int truncateFile(int fd, off_t length) override { return target_->truncateFile(fd, length); }
    int syncFile(int fd) override { return target_->syncFile(fd); }
    int reserveSpace(const char* name, int fd, off_t offset, off_t length) override {
        return target_->reserveSpace(name, fd, offset, length);
    }
    void* mapFile(void* address, size_t length, int protection, int flags, int fd,
                  off_t offset) override {
        return target_->mapFile(address, length, protection, flags, fd, offset);
    }
    int unmapFile(void* address, size_t length) override { return target_->unmapFile(address, length); }
    int syncMapping(void* address, size_t length, int flags) override {
        return target_->syncMapping(address, length, flags);
    }
    int lockRange(int fd, int command, off_t length) override {
        return target_->lockRange(fd, command, length);
    }
    int lockFile(int fd, int operation) override { return target_->lockFile(fd, operation); }
    FILE* openStream(const char* path, const char* mode) override {
        return target_->openStream(path, mode);
    }
    FILE* openStreamOnFd(int fd, const char* mode) override { return target_->openStreamOnFd(fd, mode); }
    int closeStream(FILE* stream) override { return target_->closeStream(stream); }
    int removeFile(const char* path) override { return target_->removeFile(path); }
    int renameFile(const char* from, const char* to) override { return target_->renameFile(from, to); }
    int makeDirectory(const char* path, mode_t mode) override { return target_->makeDirectory(path, mode); }
    int checkAccess(const char* path, int mode) override { return target_->checkAccess(path, mode); }
    int makeTempFile(char* pathTemplate, int suffixLength) override {
        return target_->makeTempFile(pathTemplate, suffixLength);
    }
    DIR* openDirectory(const char* path) override { return target_->openDirectory(path); }
    DIR* openDirectoryOnFd(int fd) override { return target_->openDirectoryOnFd(fd); }
    struct dirent* readDirectory(DIR* directory) override { return target_->readDirectory(directory); }
    int closeDirectory(DIR* directory) override { return target_->closeDirectory(directory); }
    int directoryFd(DIR* directory) override { return target_->directoryFd(directory); }
    int status(const char* path, struct stat* result) override { return target_->status(path, result); }
    int linkStatus(const char* path, struct stat* result) override {
        return target_->linkStatus(path, result);
    }
    int fileStatus(int fd, struct stat* result) override { return target_->fileStatus(fd, result); }
    int statusAt(int directoryFd, const char* name, struct stat* result, int flags) override {
        return target_->statusAt(directoryFd, name, result, flags);
    }
    ssize_t readLink(const char* path, char* buffer, size_t size) override {
        return target_->readLink(path, buffer, size);
    }
    char* resolvePath(const char* path, char* resolved) override {
        return target_->resolvePath(path, resolved);
    }
    char* currentDirectory(char* buffer, size_t size) override {
        return target_->currentDirectory(buffer, size);
    }
    FILE* openPipe(const char* command, const char* mode) override { return target_->openPipe(command, mode); }
    int closePipe(FILE* pipe) override { return target_->closePipe(pipe); }
    void* loadLibrary(const char* name, int flags) override { return target_->loadLibrary(name, flags); }
    void* findSymbol(void* library, const char* symbol) override {
        return target_->findSymbol(library, symbol);
    }
    int unloadLibrary(void* library) override { return target_->unloadLibrary(library); }
    const char* libraryError() override { return target_->libraryError(); }
    int fileControl(int fd, int command, long argument) override {
        return target_->fileControl(fd, command, argument);
    }
    int deviceControl(int fd, unsigned long request, void* argument) override {
        return target_->deviceControl(fd, request, argument);
    }
    int removeDirectory(const char* path) override { return target_->removeDirectory(path); }
    char* tempName(char* buffer) override { return target_->tempName(buffer); }

    ssize_t readDirectoryEntries(int fd, void* buffer, size_t size) override {
        return target_->readDirectoryEntries(fd, buffer, size);
    }

private:
    Env* target_;
};

}  // namespace fscanner

#endif
