#include "Daemon/Lifecycle/STWTestLocks.h"

#include "Daemon/STWLocks.h"
#include "common/STWLog.h"
#include "common/STWValue.h"

namespace {

bool isParkPoint(uint64_t lock) {
    return lock >= STWTestLocks::diskUsageParkPoint && lock < STWTestLocks::lockCount;
}

} // namespace

std::shared_ptr<STWTestLocks> STWTestLocks::sharedInstance() {
    // Lives for the process: the threads that hold back waiters may still be finishing
    // when static objects are destroyed at exit.
    static const auto* instance = new std::shared_ptr<STWTestLocks>(std::make_shared<STWTestLocks>());
    return *instance;
}

STWTestLocks::STWTestLocks() : _stateQueue(STWQueue::create("com.vorlane.stowlyd.STWTestLocks.stateQueue")) {
    for (uint64_t lock = diskUsageParkPoint; lock < lockCount; ++lock) {
        _lockQueue[lock] = STWConcurrentQueue::create("com.vorlane.stowlyd.STWTestLocks.lockQueue");
        _lockSemaphore[lock] = std::make_unique<std::counting_semaphore<>>(0);
    }
}

bool STWTestLocks::acquireLock(uint64_t lock) {
    if (lock >= lockCount) {
        STW_LOG_ERROR(STWLogCategory::Test, "Invalid test lock: %llu", lock);
        return false;
    }
    bool takeDaemonWide = false;
    bool acquired = _stateQueue->syncResult([&, function = __func__] {
        if (!_onQueue_updateLock(lock, 1, &takeDaemonWide))
            return false;
        STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test,
                   "Acquired test lock: %llu; count: %ld", lock, _lockCount[lock]);
        return true;
    });
    if (acquired && takeDaemonWide) {
        // Waiting for the daemon-wide lock happens here, off the state queue, so that
        // every other request to the test locks (a release above all) still gets in.
        if (lock == daemonWideWriteLock)
            lock_all_identifiers_for_writing();
        else
            lock_all_identifiers_for_reading();
        _stateQueue->sync([&] {
            --_daemonWideTakesPending;
            if (_daemonWideDropsPending > 0) {
                --_daemonWideDropsPending; // released while we waited
                unlock_all_identifiers();
            }
        });
    }
    return acquired;
}

bool STWTestLocks::releaseLock(uint64_t lock) {
    if (lock >= lockCount) {
        STW_LOG_ERROR(STWLogCategory::Test, "Invalid test lock: %llu", lock);
        return false;
    }
    return _stateQueue->syncResult([&, function = __func__] {
        if (!_onQueue_updateLock(lock, -1))
            return false;
        STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test,
                   "Released test lock: %llu; count: %ld", lock, _lockCount[lock]);
        return true;
    });
}

void STWTestLocks::releaseAllLocks() {
    _stateQueue->sync([&] { _onQueue_releaseAllLocks(); });
}

void STWTestLocks::_onQueue_releaseAllLocks() {
    _stateQueue->assertCurrent(__func__);
    for (uint64_t lock = 0; lock < lockCount; ++lock)
        _onQueue_updateLock(lock, -_lockCount[lock]);
    STW_LOG_NOTICE(STWLogCategory::Test, "Released all test locks.");
}

bool STWTestLocks::_onQueue_updateLock(uint64_t lock, int64_t delta, bool* takeDaemonWide) {
    _stateQueue->assertCurrent(__func__);
    int64_t from = _lockCount[lock];
    int64_t to = from + delta;
    if (to < 0) {
        STW_LOG_ERROR(STWLogCategory::Test, "Unbalanced update to test lock: %llu by: %ld from: %ld", lock,
                      delta, from);
        return false;
    }
    if (from == 0 && to != 0) {
        // Locks 0 and 1 share the one daemon-wide lock: whichever came second would wait
        // for the first, here on the state queue, and nothing could release the first.
        if (lock == daemonWideReadLock || lock == daemonWideWriteLock) {
            uint64_t other = lock == daemonWideReadLock ? daemonWideWriteLock : daemonWideReadLock;
            if (_lockCount[other] != 0) {
                STW_LOG_ERROR(STWLogCategory::Test,
                              "Refusing test lock: %llu while test lock: %llu holds the daemon-wide lock",
                              lock, other);
                return false;
            }
        }
        _lockCount[lock] = to;
        if (lock == daemonWideReadLock || lock == daemonWideWriteLock) {
            ++_daemonWideTakesPending;
            if (takeDaemonWide)
                *takeDaemonWide = true;
        } else {
            _onQueue_takeLock(lock);
        }
    } else if (from != 0 && to == 0) {
        _lockCount[lock] = to;
        _onQueue_dropLock(lock);
    } else {
        _lockCount[lock] = to;
    }
    return true;
}

void STWTestLocks::_onQueue_takeLock(uint64_t lock) {
    // The barrier holds back every waitOnLock() submitted after it until the release
    // signals the semaphore.
    _lockQueue[lock]->asyncBarrier([this, lock, function = __func__] {
        STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test, "Blocking waiters for lock: %llu", lock);
        _lockSemaphore[lock]->acquire();
        STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test, "Unblocking waiters for lock: %llu", lock);
    });
}

void STWTestLocks::_onQueue_dropLock(uint64_t lock) {
    switch (lock) {
    case daemonWideReadLock:
    case daemonWideWriteLock:
        // The daemon-wide lock is owned by this lock's count, not by a thread: only the
        // change back to 0 that matches the change that took it releases it. While its
        // taker still waits for it, the taker releases it once it has it.
        if (_daemonWideTakesPending == 0)
            unlock_all_identifiers();
        else
            ++_daemonWideDropsPending;
        return;
    default:
        _lockSemaphore[lock]->release();
        return;
    }
}

bool STWTestLocks::waitOnLock(uint64_t lock) {
    if (!isParkPoint(lock)) {
        STW_LOG_ERROR(STWLogCategory::Test, "Invalid test lock to wait on: %llu", lock);
        return false;
    }
    if (!enabled())
        return true;
    std::string tag = STWUUID::random().string();
    STW_LOG_NOTICE(STWLogCategory::Test, "[%s] Waiting on lock: %llu", tag, lock);
    _lockQueue[lock]->sync([] {});
    STW_LOG_NOTICE(STWLogCategory::Test, "[%s] No longer waiting on lock: %llu", tag, lock);
    return true;
}

void STWTestLocks::setEnabled(bool enabled) {
    _stateQueue->sync([&, function = __func__] {
        if (enabled) {
            _enabled = true;
            STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test, "Enabled test locks feature.");
        } else if (_enabled) {
            _onQueue_releaseAllLocks();
            _enabled = false;
            STW_LOG_FN(function, STWLogLevel::Notice, STWLogCategory::Test, "Disabled test locks feature.");
        }
    });
}

int64_t STWTestLocks::countForLock(uint64_t lock) {
    if (lock >= lockCount)
        return 0;
    return _stateQueue->syncResult([&] { return _lockCount[lock]; });
}
