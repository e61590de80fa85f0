#include "Daemon/STWLocks.h"

#include "common/STWLog.h"
#include "common/STWThreadSafety.h"

#include <algorithm>
#include <atomic>
#include <condition_variable>
#include <map>
#include <memory>
#include <mutex>
#include <shared_mutex>
#include <utility>

namespace {

constexpr uint32_t kWriteLocked = 0xFFFFFFFF;

struct LockRecord {
    std::shared_mutex rwlock;
    uint64_t referenceCount = 0;
    std::atomic<uint32_t> lockState{0};
};

struct STWLocks {
    STWMutex mutex;
    std::map<std::string, std::unique_ptr<LockRecord>, std::less<>> identifierToLockMap STW_GUARDED_BY(mutex);
    uint32_t allReaderWriterState STW_GUARDED_BY(mutex) = 0;
    uint32_t identifierReaderCount STW_GUARDED_BY(mutex) = 0;
    uint32_t identifierWriterCount STW_GUARDED_BY(mutex) = 0;
    std::condition_variable identifierWriterCondition;
    std::condition_variable identifierReaderCondition;
    std::condition_variable allWriterCondition;
    std::condition_variable allReaderCondition;

    bool _lock_nothingHeld() const STW_REQUIRES(mutex) {
        return identifierWriterCount == 0 && identifierReaderCount == 0 && allReaderWriterState == 0;
    }
};

STWLocks& gSTWLocks() {
    static STWLocks* locks = new STWLocks; // lives as long as any thread may lock
    return *locks;
}

void check(bool condition, const char* what) {
    if (!condition)
        STW_FATAL("Identifier lock invariant broken: %s", what);
}

// Sorted distinct identifiers: every locker takes them in the same order.
std::vector<std::string> sortedDistinct(const std::vector<std::string>& identifiers) {
    std::vector<std::string> sorted = identifiers;
    std::sort(sorted.begin(), sorted.end());
    sorted.erase(std::unique(sorted.begin(), sorted.end()), sorted.end());
    return sorted;
}

void _lock_identifier(const std::vector<std::string>& identifiers, bool write) {
    for (const std::string& identifier : sortedDistinct(identifiers))
        take_one_lock(identifier, write);
}

void signpost(const char* interval, bool begin) {
    STW_LOG_DEBUG(STWLogCategory::Locking, "%s %s", begin ? "begin" : "end", interval);
}

} // namespace

void take_one_lock(const std::string& identifier, bool write) {
    STWLocks& locks = gSTWLocks();
    LockRecord* record;
    {
        STWUniqueLock guard(locks.mutex);
        if (write) {
            locks.identifierWriterCondition.wait(guard.native(), [&] {
                locks.mutex.assertHeld();
                return locks.allReaderWriterState == 0;
            });
            locks.identifierWriterCount++;
        } else {
            locks.identifierReaderCondition.wait(guard.native(), [&] {
                locks.mutex.assertHeld();
                return locks.allReaderWriterState != kWriteLocked;
            });
            locks.identifierReaderCount++;
        }
        auto& slot = locks.identifierToLockMap[identifier];
        if (!slot)
            slot = std::make_unique<LockRecord>();
        record = slot.get();
        record->referenceCount++;
    }
    STW_LOG_DEBUG(STWLogCategory::Locking, "Waiting to lock %@ for %s", identifier, write ? "writing" : "reading");
    // The reference count keeps the record alive while we block outside the mutex.
    if (write) {
        record->rwlock.lock();
        uint32_t expected = 0;
        check(record->lockState.compare_exchange_strong(expected, kWriteLocked), "write lock taken while held");
        signpost("WriteLockWithIdentifier", true);
    } else {
        record->rwlock.lock_shared();
        uint32_t previous = record->lockState.fetch_add(1);
        check(previous != kWriteLocked && previous + 1 != kWriteLocked, "read lock taken while write-locked");
        signpost("ReadLockWithIdentifier", true);
    }
    STW_LOG_DEBUG(STWLogCategory::Locking, "Got lock on identifier %@", identifier);
}

void unlock_one_lock(const std::string& identifier) {
    STWLocks& locks = gSTWLocks();
    STWLockGuard guard(locks.mutex);
    auto it = locks.identifierToLockMap.find(identifier);
    check(it != locks.identifierToLockMap.end(), "unlocking an identifier that has no lock record");
    LockRecord* record = it->second.get();
    uint32_t state = record->lockState.load();
    check(state != 0, "unlocking an identifier that is not locked");
    bool wasWriter = state == kWriteLocked;
    if (!wasWriter) {
        record->lockState.fetch_sub(1);
        locks.identifierReaderCount--;
        signpost("ReadLockWithIdentifier", false);
        if (locks._lock_nothingHeld())
            locks.allWriterCondition.notify_one();
    } else {
        check(locks.allReaderWriterState == 0, "identifier write lock held under a daemon-wide lock");
        record->lockState.store(0);
        locks.identifierWriterCount--;
        signpost("WriteLockWithIdentifier", false);
        if (locks._lock_nothingHeld())
            locks.allWriterCondition.notify_one();
        if (locks.identifierWriterCount == 0 && locks.allReaderWriterState != kWriteLocked)
            locks.allReaderCondition.notify_all();
    }
    record->referenceCount--;
    if (wasWriter)
        record->rwlock.unlock();
    else
        record->rwlock.unlock_shared();
    STW_LOG_DEBUG(STWLogCategory::Locking, "Unlocked identifier %@", identifier);
    if (record->referenceCount == 0) {
        STW_LOG_DEBUG(STWLogCategory::Locking, "Destroying lock for identifier %@", identifier);
        locks.identifierToLockMap.erase(it);
    }
}

void lock_identifier_for_reading(const std::string& identifier) { lock_identifier_for_reading(std::vector{identifier}); }

void lock_identifier_for_reading(const std::vector<std::string>& identifiers) {
    signpost("WaitingForReadLockWithIdentifier", true);
    _lock_identifier(identifiers, false);
    signpost("WaitingForReadLockWithIdentifier", false);
}

void lock_identifier_for_writing(const std::string& identifier) { lock_identifier_for_writing(std::vector{identifier}); }

void lock_identifier_for_writing(const std::vector<std::string>& identifiers) {
    signpost("WaitingForWriteLockWithIdentifier", true);
    _lock_identifier(identifiers, true);
    signpost("WaitingForWriteLockWithIdentifier", false);
}

void unlock_identifier(const std::string& identifier) { unlock_one_lock(identifier); }

void unlock_identifier(const std::vector<std::string>& identifiers) {
    std::vector<std::string> sorted = sortedDistinct(identifiers);
    for (auto it = sorted.rbegin(); it != sorted.rend(); ++it)
        unlock_one_lock(*it);
}

static void _lock_all_identifiers(bool write) {
    STWLocks& locks = gSTWLocks();
    const char* mode = write ? "writing" : "reading";
    STW_LOG_DEBUG(STWLogCategory::Locking, "Waiting to lock all identifiers for %s", mode);
    STWUniqueLock guard(locks.mutex);
    if (write) {
        locks.allWriterCondition.wait(guard.native(), [&] {
            locks.mutex.assertHeld();
            return locks._lock_nothingHeld();
        });
        locks.allReaderWriterState = kWriteLocked;
        signpost("GlobalWriteLock", true);
    } else {
        locks.allReaderCondition.wait(guard.native(), [&] {
            locks.mutex.assertHeld();
            return locks.identifierWriterCount == 0 && locks.allReaderWriterState < kWriteLocked - 1;
        });
        locks.allReaderWriterState++;
        signpost("GlobalReadLock", true);
    }
    STW_LOG_DEBUG(STWLogCategory::Locking, "Locked all identifiers for %s", mode);
}

void lock_all_identifiers_for_reading() {
    signpost("WaitingForGlobalReadLock", true);
    _lock_all_identifiers(false);
    signpost("WaitingForGlobalReadLock", false);
}

void lock_all_identifiers_for_writing() {
    signpost("WaitingForGlobalWriteLock", true);
    _lock_all_identifiers(true);
    signpost("WaitingForGlobalWriteLock", false);
}

void unlock_all_identifiers() {
    STWLocks& locks = gSTWLocks();
    {
        STWLockGuard guard(locks.mutex);
        if (locks.allReaderWriterState != kWriteLocked) {
            check(locks.allReaderWriterState > 0, "unlocking all identifiers without holding them");
            locks.allReaderWriterState--;
            signpost("GlobalReadLock", false);
            if (locks.allReaderWriterState == 0)
                locks.identifierWriterCondition.notify_all();
            if (locks._lock_nothingHeld())
                locks.allWriterCondition.notify_one();
        } else {
            locks.allReaderWriterState = 0;
            signpost("GlobalWriteLock", false);
            locks.allWriterCondition.notify_one();
            locks.allReaderCondition.notify_all();
            locks.identifierWriterCondition.notify_all();
            locks.identifierReaderCondition.notify_all();
        }
    }
    STW_LOG_DEBUG(STWLogCategory::Locking, "Unlocked all identifiers");
}

STWLocksSnapshot STWLocksCurrentState() {
    STWLocks& locks = gSTWLocks();
    STWLockGuard guard(locks.mutex);
    return {locks.allReaderWriterState, locks.identifierReaderCount, locks.identifierWriterCount,
            locks.identifierToLockMap.size()};
}

STWAllIdentifiersLockGuard::STWAllIdentifiersLockGuard(STWLockMode mode, bool use) : _held(use) {
    if (!use)
        return;
    if (mode == STWLockMode::Writing)
        lock_all_identifiers_for_writing();
    else
        lock_all_identifiers_for_reading();
}

void STWAllIdentifiersLockGuard::unlock() {
    if (std::exchange(_held, false))
        unlock_all_identifiers();
}

STWIdentifierLockGuard::STWIdentifierLockGuard(std::string identifier, STWLockMode mode)
    : STWIdentifierLockGuard(std::vector<std::string>{std::move(identifier)}, mode) {}

STWIdentifierLockGuard::STWIdentifierLockGuard(std::vector<std::string> identifiers, STWLockMode mode)
    : _identifiers(std::move(identifiers)) {
    if (mode == STWLockMode::Writing)
        lock_identifier_for_writing(_identifiers);
    else
        lock_identifier_for_reading(_identifiers);
}

STWIdentifierLockGuard::~STWIdentifierLockGuard() { unlock_identifier(_identifiers); }
