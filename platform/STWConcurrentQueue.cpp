#include "platform/STWConcurrentQueue.h"

#include "common/STWLog.h"

#include <exception>
#include <thread>

std::shared_ptr<STWConcurrentQueue> STWConcurrentQueue::create(std::string name) {
    return std::make_shared<STWConcurrentQueue>(Tag{}, std::move(name));
}

STWConcurrentQueue::STWConcurrentQueue(Tag, std::string name) : _name(std::move(name)) {}

uint64_t STWConcurrentQueue::_lock_submit(bool barrier) {
    uint64_t ticket = _nextTicket++;
    _pending.insert(ticket);
    if (barrier)
        _pendingBarriers.insert(ticket);
    return ticket;
}

void STWConcurrentQueue::_waitForTurn(uint64_t ticket, bool barrier) {
    STWUniqueLock lock(_mutex);
    if (barrier) {
        // The oldest item not yet started, with nothing running.
        _changed.wait(lock.native(), [&] {
            _mutex.assertHeld();
            return *_pending.begin() == ticket && _running == 0 && !_barrierRunning;
        });
        _pendingBarriers.erase(ticket);
        _barrierRunning = true;
    } else {
        _changed.wait(lock.native(), [&] {
            _mutex.assertHeld();
            return !_barrierRunning && (_pendingBarriers.empty() || *_pendingBarriers.begin() > ticket);
        });
        ++_running;
    }
    _pending.erase(ticket);
    // Starting may let an older ordinary item or a barrier behind us go on.
    _changed.notify_all();
}

void STWConcurrentQueue::_finished(bool barrier) {
    STWLockGuard guard(_mutex);
    if (barrier)
        _barrierRunning = false;
    else
        --_running;
    _changed.notify_all();
}

void STWConcurrentQueue::sync(const std::function<void()>& work) {
    uint64_t ticket;
    {
        STWLockGuard guard(_mutex);
        ticket = _lock_submit(false);
    }
    _waitForTurn(ticket, false);
    struct Finish {
        STWConcurrentQueue* queue;
        ~Finish() { queue->_finished(false); }
    } finish{this};
    work();
}

void STWConcurrentQueue::asyncBarrier(std::function<void()> work) {
    uint64_t ticket;
    {
        STWLockGuard guard(_mutex);
        ticket = _lock_submit(true);
    }
    std::thread([self = shared_from_this(), ticket, work = std::move(work)] {
        self->_waitForTurn(ticket, true);
        try {
            work();
        } catch (const std::exception& e) {
            STW_FATAL("uncaught exception on queue %s: %s", self->_name, e.what());
        } catch (...) {
            STW_FATAL("uncaught exception on queue %s", self->_name);
        }
        self->_finished(true);
    }).detach();
}
