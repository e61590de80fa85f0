// Lock annotations that clang's thread-safety analysis checks (-Wthread-safety, on in every
// clang build): which mutex guards which data, which functions need a lock held, which
// take or give one. Other compilers see nothing.
//
// std::mutex and std::lock_guard carry no annotations in libstdc++, so the daemon's locks
// are STWMutex (and STWSharedMutex), taken through STWLockGuard, STWSharedLockGuard or,
// where a condition variable waits, STWUniqueLock.
//
// The lock order of architecture.md (identifier locks, the container cache's lock, the
// code-signing queue, the user-identity cache's lock, the configuration locks) is written
// next to each lock with STW_ACQUIRED_BEFORE/AFTER where both sides are mutexes.
#pragma once

#include <mutex>
#include <shared_mutex>

#if defined(__clang__)
#define STW_THREAD_ANNOTATION(x) __attribute__((x))
#else
#define STW_THREAD_ANNOTATION(x)
#endif

#define STW_CAPABILITY(x) STW_THREAD_ANNOTATION(capability(x))
#define STW_SCOPED_CAPABILITY STW_THREAD_ANNOTATION(scoped_lockable)
#define STW_GUARDED_BY(x) STW_THREAD_ANNOTATION(guarded_by(x))
#define STW_PT_GUARDED_BY(x) STW_THREAD_ANNOTATION(pt_guarded_by(x))
#define STW_ACQUIRED_BEFORE(...) STW_THREAD_ANNOTATION(acquired_before(__VA_ARGS__))
#define STW_ACQUIRED_AFTER(...) STW_THREAD_ANNOTATION(acquired_after(__VA_ARGS__))
#define STW_REQUIRES(...) STW_THREAD_ANNOTATION(requires_capability(__VA_ARGS__))
#define STW_REQUIRES_SHARED(...) STW_THREAD_ANNOTATION(requires_shared_capability(__VA_ARGS__))
#define STW_ACQUIRE(...) STW_THREAD_ANNOTATION(acquire_capability(__VA_ARGS__))
#define STW_ACQUIRE_SHARED(...) STW_THREAD_ANNOTATION(acquire_shared_capability(__VA_ARGS__))
#define STW_RELEASE(...) STW_THREAD_ANNOTATION(release_capability(__VA_ARGS__))
#define STW_RELEASE_SHARED(...) STW_THREAD_ANNOTATION(release_shared_capability(__VA_ARGS__))
#define STW_RELEASE_GENERIC(...) STW_THREAD_ANNOTATION(release_generic_capability(__VA_ARGS__))
#define STW_TRY_ACQUIRE(...) STW_THREAD_ANNOTATION(try_acquire_capability(__VA_ARGS__))
#define STW_EXCLUDES(...) STW_THREAD_ANNOTATION(locks_excluded(__VA_ARGS__))
#define STW_RETURN_CAPABILITY(x) STW_THREAD_ANNOTATION(lock_returned(x))
#define STW_NO_THREAD_SAFETY_ANALYSIS STW_THREAD_ANNOTATION(no_thread_safety_analysis)

class STW_CAPABILITY("mutex") STWMutex {
public:
    void lock() STW_ACQUIRE() { _mutex.lock(); }
    void unlock() STW_RELEASE() { _mutex.unlock(); }
    bool try_lock() STW_TRY_ACQUIRE(true) { return _mutex.try_lock(); }
    // Tells the analysis that the caller holds this mutex where it cannot see it.
    void assertHeld() const STW_THREAD_ANNOTATION(assert_capability(this)) {}

private:
    friend class STWUniqueLock;
    std::mutex _mutex;
};

class STW_CAPABILITY("mutex") STWSharedMutex {
public:
    void lock() STW_ACQUIRE() { _mutex.lock(); }
    void unlock() STW_RELEASE() { _mutex.unlock(); }
    void lock_shared() STW_ACQUIRE_SHARED() { _mutex.lock_shared(); }
    void unlock_shared() STW_RELEASE_SHARED() { _mutex.unlock_shared(); }

private:
    std::shared_mutex _mutex;
};

// Holds any annotated lock (STWMutex, STWSharedMutex exclusively, or a capability class
// of its own with lock() and unlock()) for its scope.
template <class Mutex>
class STW_SCOPED_CAPABILITY STWLockGuard {
public:
    explicit STWLockGuard(Mutex& mutex) STW_ACQUIRE(mutex) : _mutex(mutex) { _mutex.lock(); }
    ~STWLockGuard() STW_RELEASE() { _mutex.unlock(); }
    STWLockGuard(const STWLockGuard&) = delete;
    STWLockGuard& operator=(const STWLockGuard&) = delete;

private:
    Mutex& _mutex;
};

class STW_SCOPED_CAPABILITY STWSharedLockGuard {
public:
    explicit STWSharedLockGuard(STWSharedMutex& mutex) STW_ACQUIRE_SHARED(mutex) : _mutex(mutex) {
        _mutex.lock_shared();
    }
    ~STWSharedLockGuard() STW_RELEASE_GENERIC() { _mutex.unlock_shared(); }
    STWSharedLockGuard(const STWSharedLockGuard&) = delete;
    STWSharedLockGuard& operator=(const STWSharedLockGuard&) = delete;

private:
    STWSharedMutex& _mutex;
};

// A held STWMutex that a condition variable can wait on (through native()); unlock() and
// lock() let go of it and take it again within the scope.
class STW_SCOPED_CAPABILITY STWUniqueLock {
public:
    explicit STWUniqueLock(STWMutex& mutex) STW_ACQUIRE(mutex) : _lock(mutex._mutex) {}
    ~STWUniqueLock() STW_RELEASE() {}
    STWUniqueLock(const STWUniqueLock&) = delete;
    STWUniqueLock& operator=(const STWUniqueLock&) = delete;
    void lock() STW_ACQUIRE() { _lock.lock(); }
    void unlock() STW_RELEASE() { _lock.unlock(); }
    std::unique_lock<std::mutex>& native() { return _lock; }

private:
    std::unique_lock<std::mutex> _lock;
};
