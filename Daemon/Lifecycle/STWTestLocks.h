// Test locks: let a test client reproduce races in a running daemon.
//
// Locks 0 and 1 hold the daemon-wide identifier lock for reading and for writing while
// their count is above zero. Locks 2 to 5 are park points: while one is held, every
// request that calls waitOnLock() for it (2 is the park point before a disk-usage
// computation) waits until it is released. Parking happens only while the facility is
// enabled. The setTestLock command of internal builds drives this object.
#pragma once

#include "platform/STWConcurrentQueue.h"
#include "platform/STWQueue.h"

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <semaphore>

class STWTestLocks {
public:
    static constexpr uint64_t lockCount = 6;
    static constexpr uint64_t daemonWideReadLock = 0;
    static constexpr uint64_t daemonWideWriteLock = 1;
    static constexpr uint64_t diskUsageParkPoint = 2;

    static std::shared_ptr<STWTestLocks> sharedInstance();
    STWTestLocks();

    // Counted: the lock is taken when its count leaves 0 and released when it returns
    // there. Lock 1 returns only once the daemon-wide write lock is held. False for a lock
    // number out of range, for a release that would take the count below 0, and for
    // taking lock 0 or 1 while the other holds the daemon-wide lock, which could never
    // succeed.
    bool acquireLock(uint64_t lock);
    bool releaseLock(uint64_t lock);
    void releaseAllLocks();
    // Parks the caller while park point `lock` (2 to 5) is held and the facility is
    // enabled. False, at once, for any other lock number.
    bool waitOnLock(uint64_t lock);

    void setEnabled(bool enabled);
    bool enabled() const { return _enabled.load(); }

    const std::shared_ptr<STWQueue>& stateQueue() const { return _stateQueue; }

    // Hold count of `lock` (0 for a number out of range), for tests and diagnostics.
    int64_t countForLock(uint64_t lock);

    STWTestLocks(const STWTestLocks&) = delete;
    STWTestLocks& operator=(const STWTestLocks&) = delete;

private:
    // `takeDaemonWide` is set when the caller must now take the daemon-wide lock for lock 0
    // or 1 (off the state queue, since that may wait).
    bool _onQueue_updateLock(uint64_t lock, int64_t delta, bool* takeDaemonWide = nullptr);
    void _onQueue_releaseAllLocks();
    void _onQueue_takeLock(uint64_t lock);
    void _onQueue_dropLock(uint64_t lock);

    std::array<int64_t, lockCount> _lockCount{};
    // Park points only; none for locks 0 and 1.
    std::array<std::shared_ptr<STWConcurrentQueue>, lockCount> _lockQueue;
    std::array<std::unique_ptr<std::counting_semaphore<>>, lockCount> _lockSemaphore;
    std::atomic<bool> _enabled{false};
    // On the state queue: takes of the daemon-wide lock decided but not yet done, and
    // releases that came meanwhile (their takers release as soon as they have the lock).
    int64_t _daemonWideTakesPending = 0;
    int64_t _daemonWideDropsPending = 0;
    std::shared_ptr<STWQueue> _stateQueue;
};
