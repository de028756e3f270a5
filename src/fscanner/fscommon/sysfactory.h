// The one factory of platform objects: files, locks, threads, sleep.
//
// Every object returned belongs to the caller, who deletes it.  No file
// operation happens here: create() or open() comes next.  A null name gives
// null.  All operations are static and safe from any thread.
#ifndef FSCANNER_FSCOMMON_SYSFACTORY_H
#define FSCANNER_FSCOMMON_SYSFACTORY_H

#include "fscanner/fscommon/sync.h"
#include "fscanner/fscommon/sysfile.h"

// Work item for a thread; threads are not provided on this platform, so no
// object of this kind is ever run by the library.
class Runnable {
public:
    virtual ~Runnable() {}
    virtual void run() = 0;
};

class AbstractThread;

class SysFactory {
public:
    // A new StdFile that copies name.
    static AbstractStdFile* createStdFile(wchar_t const* name);
    // A new LinuxMmFile on the multibyte form of name.
    static AbstractMmFile* createMmFile(wchar_t const* name);
    // A new LinuxSharedMutex (a file lock under LinuxSharedMutex::storePath)
    // on the multibyte form of name.  Never an in-process LinuxMutex.
    static AbstractMutex* createMutex(wchar_t const* name);
    // A new LinuxSemaphore (in-process, named) on the multibyte form of name.
    static AbstractSemaphore* createSemaphore(wchar_t const* name);
    // Always null: threads are not provided.
    static AbstractThread* createThread(Runnable* runnable);
    static AbstractThread* createThread(Runnable* runnable, long stackSize);
    // Sleeps the calling thread for the given milliseconds.
    static void sleep(unsigned int milliseconds);
};

#endif
