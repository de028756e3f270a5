#include "fscanner/fscommon/sysfactory.h"

#include <unistd.h>

#include "fscanner/fscommon/utils.h"

AbstractStdFile* SysFactory::createStdFile(wchar_t const* name) {
    if (name == nullptr) return nullptr;
    return new StdFile(name);
}

AbstractMmFile* SysFactory::createMmFile(wchar_t const* name) {
    if (name == nullptr) return nullptr;
    char* narrow = utils::myWcsToMbsString(name);
    AbstractMmFile* file = new LinuxMmFile(narrow);
    delete[] narrow;
    return file;
}

AbstractMutex* SysFactory::createMutex(wchar_t const* name) {
    if (name == nullptr) return nullptr;
    char* narrow = utils::myWcsToMbsString(name);
    AbstractMutex* mutex = new LinuxSharedMutex(narrow);
    delete[] narrow;
    return mutex;
}

AbstractSemaphore* SysFactory::createSemaphore(wchar_t const* name) {
    if (name == nullptr) return nullptr;
    char* narrow = utils::myWcsToMbsString(name);
    AbstractSemaphore* semaphore = new LinuxSemaphore(std::string(narrow != nullptr ? narrow : ""));
    delete[] narrow;
    return semaphore;
}

AbstractThread* SysFactory::createThread(Runnable*) { return nullptr; }

AbstractThread* SysFactory::createThread(Runnable*, long) { return nullptr; }

void SysFactory::sleep(unsigned int milliseconds) { usleep(static_cast<useconds_t>(milliseconds) * 1000); }
