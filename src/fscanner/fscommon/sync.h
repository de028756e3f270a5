// Named locks of the record store and the cache.
//
// Three kinds share AbstractSync:
//   LinuxSharedMutex  lockf lock on a file under storePath; excludes other
//                     processes, never two objects of one process.  The only
//                     kind SysFactory::createMutex hands out.
//   LinuxMutex        named mutex inside one process; all objects of one
//                     name share one registry entry (reference counted).
//   LinuxSemaphore    named semaphore inside one process, same registry shape.
// wait results: SYNC_ACQUIRED 0, SYNC_TIMED_OUT -20, SYNC_FAILED -21.
// Constructors never fail visibly; a lock that could not be set up answers
// its operations with failure codes.
#ifndef FSCANNER_FSCOMMON_SYNC_H
#define FSCANNER_FSCOMMON_SYNC_H

#include <pthread.h>
#include <time.h>

#include <cstdint>
#include <map>
#include <string>

const int SYNC_ACQUIRED = 0;
const int SYNC_TIMED_OUT = -20;
const int SYNC_FAILED = -21;

class AbstractSync {
public:
    // Gives the lock back.  The result's meaning depends on the kind.
    virtual int release() = 0;
    // Blocks until acquired: 0, or -21 on failure.
    virtual int wait() = 0;
    // Waits at most about timeout milliseconds: 0, -20 timed out, -21 failed.
    virtual int wait(long timeout) = 0;
    virtual ~AbstractSync() {}
};

class AbstractMutex : public AbstractSync {};
class AbstractSemaphore : public AbstractSync {};

// Attributes for every pthread object made here: the defaults.
extern pthread_mutexattr_t* const DEFAULT_MUTEX_ATTR;
extern pthread_condattr_t* const DEFAULT_COND_ATTR;

// The library's own counting primitive.  Its counter runs the opposite way to
// a textbook semaphore: a post moves it from 0 to -1, a wait that finds it
// non-zero moves it back towards 0, a wait on 0 blocks.  It starts at 0.
struct _sem_t {
    pthread_mutex_t mutex;
    pthread_cond_t cond;
    int32_t counter;
};

struct _sem_info {
    _sem_t sem;
    uint32_t refCount;
};

struct _mutex_info {
    pthread_mutex_t mutex;
    pthread_cond_t cond;
    unsigned char locked;
    uint32_t refCount;
};

// Operations on _sem_t.  They overload the platform names by argument type.
// Results are pthread results: 0 on success.
int sem_init(_sem_t* sem, int unused, unsigned int value);
int sem_destroy(_sem_t* sem);
int sem_wait(_sem_t* sem);
int sem_timedwait(_sem_t* sem, timespec* deadline);
int sem_post(_sem_t* sem);
// Unlocks the _sem_t's mutex; a cancellation cleanup for waiters.
void cancel_cleanup(void* sem);

// Absolute deadline for a wait of timeout milliseconds, computed from
// gettimeofday.  The milliseconds under one second are added to the
// microseconds unscaled, and the carry then nearly always fires: the real wait
// is the whole seconds of timeout plus about one second.  Both in-process
// locks depend on this exact arithmetic.
timespec syncDeadline(long timeout);

class LinuxSharedMutex : public AbstractMutex {
public:
    // Directory of every lock file built afterwards, with its final "/";
    // empty at start (lock files then go to the current directory).
    static char storePath[1024];
    // null: false.  Ending in "/": copied when it fits (<= 1023), silently
    // kept out otherwise, true either way.  No final "/": copied with "/"
    // appended when <= 1022 long and true, else false.
    static bool setStorePath(char const* path);

    // Opens (creates) storePath + name, mode 0600.  Null name or a failed
    // open leaves descriptor -1; every operation then fails.
    explicit LinuxSharedMutex(char const* name);
    // close(), unlink of the lock file, free of the name.  Unlinking happens
    // even while another process holds the file.
    ~LinuxSharedMutex() override;

    // lockf F_ULOCK result; -1 without a file.
    int release() override;
    // lockf F_LOCK, unbounded: 0 or -21.
    int wait() override;
    // Rounds of 100 ms: ceil(timeout / 100) attempts with F_TLOCK, each failed
    // one followed by a 100 ms sleep; -20 after the last sleep; -20 at once
    // for timeout <= 0; -21 on another error or without a file.
    int wait(long timeout) override;
    // Closes the descriptor (which keeps its value); -1 without one.
    int close();

    int descriptor() const { return fd; }
    char const* fileName() const { return name; }

private:
    LinuxSharedMutex(const LinuxSharedMutex&) = delete;
    LinuxSharedMutex& operator=(const LinuxSharedMutex&) = delete;

    int32_t fd;
    char* name;
};

class LinuxMutex : public AbstractMutex {
public:
    explicit LinuxMutex(std::string name);
    ~LinuxMutex() override;

    // Clears locked and signals; does not check who holds it.  Returns 0.
    int release() override;
    int wait() override;
    int wait(long timeout) override;

    static pthread_mutex_t internal_accessMutex;
    static unsigned int istances;
    static bool mutexes;
    static std::map<std::string, _mutex_info*>* mutexes_ptr();

    // Registry entry: found -> reference count + 1, false; new -> true.
    static bool mutex_init(std::string name, _mutex_info** info);
    // Count 1: destroys and erases the entry; otherwise decrements.
    static void mutex_exit(std::string name, _mutex_info* info);
    // Releases the inner mutex of a cancelled waiter.
    static void cancel_cleanup(void* info);

    _mutex_info* sharedInfo() const { return info; }
    bool createdEntry() const { return created; }

private:
    LinuxMutex(const LinuxMutex&) = delete;
    LinuxMutex& operator=(const LinuxMutex&) = delete;

    std::string name;
    _mutex_info* info;
    bool created;
};

class LinuxSemaphore : public AbstractSemaphore {
public:
    explicit LinuxSemaphore(std::string name);
    ~LinuxSemaphore() override;

    // sem_post result.
    int release() override;
    int wait() override;
    int wait(long timeout) override;

    static pthread_mutex_t accessMutex;
    static unsigned int istances;
    static bool semaphores;
    static std::map<std::string, _sem_info*>* semaphores_ptr();

    static bool semaphore_init(std::string name, _sem_info** info);
    static void semaphore_exit(std::string name, _sem_info* info);

    _sem_info* sharedInfo() const { return info; }
    bool createdEntry() const { return created; }

private:
    LinuxSemaphore(const LinuxSemaphore&) = delete;
    LinuxSemaphore& operator=(const LinuxSemaphore&) = delete;

    std::string name;
    _sem_info* info;
    bool created;
};

// Sets up the two registry access mutexes for the life of the library; one
// static object of this class exists in sync.cpp.
class LinuxSyncInit {
public:
    LinuxSyncInit();
    ~LinuxSyncInit();
};

#endif
