// Concurrent queues with barriers.
//
// Ordinary items of a concurrent queue run side by side. A barrier item waits until every
// item submitted before it has finished, runs alone, and holds back every item submitted
// after it until it has run. The test locks park requests behind such a barrier; nothing
// on a hot path uses this queue, so each barrier simply gets a thread of its own.
#pragma once

#include "common/STWThreadSafety.h"

#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <string>

class STWConcurrentQueue : public std::enable_shared_from_this<STWConcurrentQueue> {
public:
    static std::shared_ptr<STWConcurrentQueue> create(std::string name);

    const std::string& name() const { return _name; }

    // Runs `work` on the caller's thread as soon as no barrier submitted before it is
    // pending or running. Exceptions thrown by `work` reach the caller.
    void sync(const std::function<void()>& work);
    // Runs `work` on a thread of its own, alone, after the items submitted before it.
    void asyncBarrier(std::function<void()> work);

    STWConcurrentQueue(const STWConcurrentQueue&) = delete;
    STWConcurrentQueue& operator=(const STWConcurrentQueue&) = delete;

private:
    struct Tag {};

public:
    STWConcurrentQueue(Tag, std::string name);

private:
    // Tickets are taken at submission, so the order of submission decides the order of
    // barriers and ordinary items, whichever thread gets to run first.
    uint64_t _lock_submit(bool barrier) STW_REQUIRES(_mutex);
    void _waitForTurn(uint64_t ticket, bool barrier);
    void _finished(bool barrier);

    const std::string _name;
    STWMutex _mutex;
    std::condition_variable _changed;
    uint64_t _nextTicket STW_GUARDED_BY(_mutex) = 0;
    std::set<uint64_t> _pending STW_GUARDED_BY(_mutex);         // submitted, not started
    std::set<uint64_t> _pendingBarriers STW_GUARDED_BY(_mutex); // the barriers among them
    size_t _running STW_GUARDED_BY(_mutex) = 0;                 // ordinary items running
    bool _barrierRunning STW_GUARDED_BY(_mutex) = false;
};
