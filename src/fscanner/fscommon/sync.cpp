#include "fscanner/fscommon/sync.h"

#include <errno.h>
#include <fcntl.h>
#include <sys/time.h>
#include <unistd.h>

#include <cstring>

#include "base/kelmem.h"
#include "fscanner/fscommon/env.h"

pthread_mutexattr_t* const DEFAULT_MUTEX_ATTR = nullptr;
pthread_condattr_t* const DEFAULT_COND_ATTR = nullptr;

// The access mutexes are also statically initialised, so that a lock object
// built by another translation unit's static initialiser still finds usable
// mutexes; LinuxSyncInit then initialises them once more with the default
// attributes while nothing holds them.
pthread_mutex_t LinuxMutex::internal_accessMutex = PTHREAD_MUTEX_INITIALIZER;
unsigned int LinuxMutex::istances = 0;
bool LinuxMutex::mutexes = false;

pthread_mutex_t LinuxSemaphore::accessMutex = PTHREAD_MUTEX_INITIALIZER;
unsigned int LinuxSemaphore::istances = 0;
bool LinuxSemaphore::semaphores = false;

char LinuxSharedMutex::storePath[1024] = {0};

namespace {

std::map<std::string, _mutex_info*>* mutexRegistry = nullptr;
std::map<std::string, _sem_info*>* semaphoreRegistry = nullptr;

// Must be defined after the statics above: it initialises them.
LinuxSyncInit linuxSyncInit;

// The entry of key in a process-wide registry (mutexes or semaphores) with
// one more user; for a new key, a fresh entry of one user, set up by prepare,
// is entered.  True when the entry is new.
template <class Info, class Prepare>
bool shareEntry(std::map<std::string, Info*>& registry, const std::string& key, Info** out,
                Prepare prepare) {
    auto it = registry.find(key);
    if (it != registry.end()) {
        it->second->refCount++;
        *out = it->second;
        return false;
    }
    Info* info = new Info;
    info->refCount = 1;
    prepare(info);
    registry[key] = info;
    *out = info;
    return true;
}

}  // namespace

LinuxSyncInit::LinuxSyncInit() {
    pthread_mutex_init(&LinuxMutex::internal_accessMutex, DEFAULT_MUTEX_ATTR);
    pthread_mutex_init(&LinuxSemaphore::accessMutex, DEFAULT_MUTEX_ATTR);
}

LinuxSyncInit::~LinuxSyncInit() {
    pthread_mutex_destroy(&LinuxMutex::internal_accessMutex);
    pthread_mutex_destroy(&LinuxSemaphore::accessMutex);
}

// ---- deadline -----------------------------------------------------------------

timespec syncDeadline(long timeout) {
    struct timeval now;
    gettimeofday(&now, nullptr);
    timespec deadline;
    deadline.tv_sec = now.tv_sec + timeout / 1000;
    // Milliseconds added to microseconds unscaled; the carry below then fires
    // for nearly every clock reading.  Kept exactly so.
    long sub = static_cast<long>(now.tv_usec) + timeout % 1000;
    if (sub > 999) {
        deadline.tv_sec += 1;
        sub -= 1000;
    }
    // A negative timeout can leave a negative field; clamp into what the
    // pthread calls accept instead of letting them fail with EINVAL.
    if (sub < 0) sub = 0;
    long long nanos = static_cast<long long>(sub) * 1000;
    if (nanos > 999999999LL) nanos = 999999999LL;
    deadline.tv_nsec = static_cast<long>(nanos);
    return deadline;
}

// ---- _sem_t -------------------------------------------------------------------

int sem_init(_sem_t* sem, int, unsigned int value) {
    sem->counter = static_cast<int32_t>(value);
    int rc = pthread_mutex_init(&sem->mutex, nullptr);
    if (rc != 0) return rc;
    return pthread_cond_init(&sem->cond, nullptr);
}

int sem_destroy(_sem_t* sem) {
    int rc = pthread_mutex_destroy(&sem->mutex);
    if (rc != 0) return rc;
    return pthread_cond_destroy(&sem->cond);
}

void cancel_cleanup(void* sem) { pthread_mutex_unlock(&static_cast<_sem_t*>(sem)->mutex); }

int sem_wait(_sem_t* sem) {
    int rc = pthread_mutex_lock(&sem->mutex);
    if (rc != 0) return rc;
    pthread_cleanup_push(cancel_cleanup, sem);
    while (sem->counter == 0 && rc == 0) rc = pthread_cond_wait(&sem->cond, &sem->mutex);
    if (rc == 0) sem->counter++;
    pthread_cleanup_pop(0);
    pthread_mutex_unlock(&sem->mutex);
    return rc;
}

int sem_timedwait(_sem_t* sem, timespec* deadline) {
    int rc = pthread_mutex_lock(&sem->mutex);
    if (rc != 0) return rc;
    pthread_cleanup_push(cancel_cleanup, sem);
    while (sem->counter == 0 && rc == 0) rc = pthread_cond_timedwait(&sem->cond, &sem->mutex, deadline);
    if (rc == 0) sem->counter++;
    pthread_cleanup_pop(0);
    pthread_mutex_unlock(&sem->mutex);
    return rc;
}

int sem_post(_sem_t* sem) {
    pthread_mutex_lock(&sem->mutex);
    sem->counter--;
    if (sem->counter < 1) pthread_cond_signal(&sem->cond);
    return pthread_mutex_unlock(&sem->mutex);
}

// ---- LinuxSharedMutex ---------------------------------------------------------

bool LinuxSharedMutex::setStorePath(char const* path) {
    if (path == nullptr) return false;
    size_t len = strlen(path);
    if (len > 0 && path[len - 1] == '/') {
        // Too long a path with its "/" is silently kept out, and still true.
        if (len <= 1023) std::memcpy(storePath, path, len + 1);
        return true;
    }
    if (len > 1022) return false;
    std::memcpy(storePath, path, len);
    storePath[len] = '/';
    storePath[len + 1] = 0;
    return true;
}

LinuxSharedMutex::LinuxSharedMutex(char const* lockName) : fd(-1), name(nullptr) {
    if (lockName == nullptr) return;
    size_t a = strlen(storePath);
    size_t b = strlen(lockName);
    name = static_cast<char*>(kelm_malloc(a + b + 1));
    if (name == nullptr) return;
    std::memcpy(name, storePath, a);
    std::memcpy(name + a, lockName, b + 1);
    fd = fscanner::Env::Current()->openFile(name, O_RDWR | O_CREAT, 0600);
}

LinuxSharedMutex::~LinuxSharedMutex() {
    close();
    if (name != nullptr) fscanner::Env::Current()->removeFile(name);
    kelm_free(name);
}

int LinuxSharedMutex::release() {
    if (fd == -1) return -1;
    return fscanner::Env::Current()->lockRange(fd, F_ULOCK, 0);
}

int LinuxSharedMutex::wait() {
    if (fd == -1) return SYNC_FAILED;
    return fscanner::Env::Current()->lockRange(fd, F_LOCK, 0) == 0 ? SYNC_ACQUIRED : SYNC_FAILED;
}

int LinuxSharedMutex::wait(long timeout) {
    if (fd == -1) return SYNC_FAILED;
    long rounds = timeout / 100;
    if (timeout % 100 > 0) rounds += 1;
    fscanner::Env* env = fscanner::Env::Current();
    for (long i = 0; i < rounds; ++i) {
        if (env->lockRange(fd, F_TLOCK, 0) == 0) return SYNC_ACQUIRED;
        if (errno != EAGAIN && errno != EACCES) return SYNC_FAILED;
        usleep(100000);
    }
    return SYNC_TIMED_OUT;
}

int LinuxSharedMutex::close() {
    if (fd == -1) return -1;
    // The descriptor value stays; only a second close can tell, and it fails.
    return fscanner::Env::Current()->closeFile(fd);
}

// ---- LinuxMutex ---------------------------------------------------------------

std::map<std::string, _mutex_info*>* LinuxMutex::mutexes_ptr() {
    if (mutexRegistry == nullptr) {
        mutexRegistry = new std::map<std::string, _mutex_info*>();
        mutexes = true;
    }
    return mutexRegistry;
}

bool LinuxMutex::mutex_init(std::string key, _mutex_info** out) {
    return shareEntry(*mutexes_ptr(), key, out, [](_mutex_info* info) {
        info->locked = 0;
        pthread_mutex_init(&info->mutex, DEFAULT_MUTEX_ATTR);
        pthread_cond_init(&info->cond, DEFAULT_COND_ATTR);
    });
}

void LinuxMutex::mutex_exit(std::string key, _mutex_info* info) {
    if (info == nullptr) return;
    if (info->refCount == 1) {
        pthread_mutex_destroy(&info->mutex);
        pthread_cond_destroy(&info->cond);
        mutexes_ptr()->erase(key);
        delete info;
    } else {
        info->refCount--;
    }
}

void LinuxMutex::cancel_cleanup(void* info) { pthread_mutex_unlock(&static_cast<_mutex_info*>(info)->mutex); }

LinuxMutex::LinuxMutex(std::string mutexName) : name(mutexName), info(nullptr), created(false) {
    pthread_mutex_lock(&internal_accessMutex);
    created = mutex_init(name, &info);
    istances++;
    pthread_mutex_unlock(&internal_accessMutex);
}

LinuxMutex::~LinuxMutex() {
    pthread_mutex_lock(&internal_accessMutex);
    mutex_exit(name, info);
    istances--;
    if (istances == 0) {
        delete mutexRegistry;
        mutexRegistry = nullptr;
        mutexes = false;
    }
    pthread_mutex_unlock(&internal_accessMutex);
}

int LinuxMutex::wait() {
    pthread_mutex_lock(&info->mutex);
    int result = SYNC_ACQUIRED;
    pthread_cleanup_push(LinuxMutex::cancel_cleanup, info);
    while (info->locked) {
        if (pthread_cond_wait(&info->cond, &info->mutex) != 0) {
            result = SYNC_FAILED;
            break;
        }
    }
    if (result == SYNC_ACQUIRED) info->locked = 1;
    pthread_cleanup_pop(0);
    pthread_mutex_unlock(&info->mutex);
    return result;
}

int LinuxMutex::wait(long timeout) {
    pthread_mutex_lock(&info->mutex);
    timespec deadline = syncDeadline(timeout);
    int rc = 0;
    int result;
    pthread_cleanup_push(LinuxMutex::cancel_cleanup, info);
    while (info->locked && rc == 0) rc = pthread_cond_timedwait(&info->cond, &info->mutex, &deadline);
    // A wait that timed out stays timed out even if the lock came free at
    // that instant.
    if (!info->locked && rc == 0) {
        info->locked = 1;
        result = SYNC_ACQUIRED;
    } else {
        result = (rc == ETIMEDOUT) ? SYNC_TIMED_OUT : SYNC_FAILED;
    }
    pthread_cleanup_pop(0);
    pthread_mutex_unlock(&info->mutex);
    return result;
}

int LinuxMutex::release() {
    pthread_mutex_lock(&info->mutex);
    info->locked = 0;
    pthread_mutex_unlock(&info->mutex);
    pthread_cond_signal(&info->cond);
    return 0;
}

// ---- LinuxSemaphore -----------------------------------------------------------

std::map<std::string, _sem_info*>* LinuxSemaphore::semaphores_ptr() {
    if (semaphoreRegistry == nullptr) {
        semaphoreRegistry = new std::map<std::string, _sem_info*>();
        semaphores = true;
    }
    return semaphoreRegistry;
}

bool LinuxSemaphore::semaphore_init(std::string key, _sem_info** out) {
    return shareEntry(*semaphores_ptr(), key, out,
                      [](_sem_info* info) { sem_init(&info->sem, 0, 0); });
}

void LinuxSemaphore::semaphore_exit(std::string key, _sem_info* info) {
    if (info == nullptr) return;
    if (info->refCount == 1) {
        sem_destroy(&info->sem);
        semaphores_ptr()->erase(key);
        delete info;
    } else {
        info->refCount--;
    }
}

LinuxSemaphore::LinuxSemaphore(std::string semName) : name(semName), info(nullptr), created(false) {
    pthread_mutex_lock(&accessMutex);
    created = semaphore_init(name, &info);
    istances++;
    pthread_mutex_unlock(&accessMutex);
}

LinuxSemaphore::~LinuxSemaphore() {
    pthread_mutex_lock(&accessMutex);
    semaphore_exit(name, info);
    istances--;
    if (istances == 0) {
        delete semaphoreRegistry;
        semaphoreRegistry = nullptr;
        semaphores = false;
    }
    pthread_mutex_unlock(&accessMutex);
}

int LinuxSemaphore::release() { return sem_post(&info->sem); }

int LinuxSemaphore::wait() { return sem_wait(&info->sem) == 0 ? SYNC_ACQUIRED : SYNC_FAILED; }

int LinuxSemaphore::wait(long timeout) {
    timespec deadline = syncDeadline(timeout);
    int rc = sem_timedwait(&info->sem, &deadline);
    if (rc == 0) return SYNC_ACQUIRED;
    return rc == ETIMEDOUT ? SYNC_TIMED_OUT : SYNC_FAILED;
}
