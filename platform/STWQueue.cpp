#include "platform/STWQueue.h"

#include <system_error>

#include "common/STWLog.h"
#include "platform/STWTransaction.h"

#include <algorithm>
#include <chrono>
#include <sys/resource.h>
#include <unistd.h>
#include <vector>

namespace {

// The queues the calling thread is running, innermost last.
thread_local std::vector<const STWQueue*> currentQueues;

struct CurrentQueue {
    explicit CurrentQueue(const STWQueue* q) { currentQueues.push_back(q); }
    ~CurrentQueue() { currentQueues.pop_back(); }
};

// Threads that drain queues. A thread is added whenever work waits and no thread is idle,
// so work that blocks (file I/O, locks, synchronous submission to another queue) never
// starves the queues behind it; threads idle for a while go away. The pool has a bound:
// past it, work waits for a thread to come free. A thread that cannot be created is
// logged, and the work waits for the threads there are (or for the next submission).
class WorkerPool {
public:
    static constexpr size_t maximumThreads = 64;

    explicit WorkerPool(STWQueue::Priority priority) : _priority(priority) {}

    void submit(std::function<void()> task) {
        STWLockGuard guard(_mutex);
        _tasks.push_back(std::move(task));
        if (_tasks.size() <= _idle) {
            _available.notify_one();
            return;
        }
        if (_threads >= maximumThreads)
            return;
        try {
            std::thread([this] { _work(); }).detach();
            ++_threads;
        } catch (const std::system_error& e) {
            STW_LOG_ERROR(STWLogCategory::Unspecified, "Cannot start a queue thread (%zu running): %s", _threads,
                          e.what());
        }
    }

private:
    void _work() {
        if (_priority != STWQueue::Priority::Default)
            setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()),
                        _priority == STWQueue::Priority::Background ? 19 : -5);
        STWUniqueLock lock(_mutex);
        while (true) {
            if (_tasks.empty()) {
                ++_idle;
                bool woken = _available.wait_for(lock.native(), std::chrono::seconds(10), [&] {
                    _mutex.assertHeld();
                    return !_tasks.empty();
                });
                --_idle;
                if (!woken) {
                    --_threads;
                    return;
                }
            }
            std::function<void()> task = std::move(_tasks.front());
            _tasks.pop_front();
            lock.unlock();
            task();
            task = nullptr;
            lock.lock();
        }
    }

    const STWQueue::Priority _priority;
    STWMutex _mutex;
    std::condition_variable _available;
    std::deque<std::function<void()>> _tasks STW_GUARDED_BY(_mutex);
    size_t _idle STW_GUARDED_BY(_mutex) = 0;
    size_t _threads STW_GUARDED_BY(_mutex) = 0;
};

WorkerPool& pool(STWQueue::Priority priority) {
    // Leaked on purpose: detached workers may still run while static objects are destroyed.
    static WorkerPool* defaultPool = new WorkerPool(STWQueue::Priority::Default);
    static WorkerPool* backgroundPool = new WorkerPool(STWQueue::Priority::Background);
    static WorkerPool* userInitiatedPool = new WorkerPool(STWQueue::Priority::UserInitiated);
    switch (priority) {
    case STWQueue::Priority::Background:
        return *backgroundPool;
    case STWQueue::Priority::UserInitiated:
        return *userInitiatedPool;
    default:
        return *defaultPool;
    }
}

// Items run per turn on a pool thread before the queue yields it to others.
constexpr int kItemsPerTurn = 64;

} // namespace

std::shared_ptr<STWQueue> STWQueue::create(std::string name, Attributes attributes) {
    return std::make_shared<STWQueue>(Tag{}, std::move(name), attributes);
}

STWQueue::STWQueue(Tag, std::string name, Attributes attributes)
    : _name(std::move(name)), _attributes(attributes) {}

STWQueue::~STWQueue() {
    // Pending items hold a reference to the queue, so none can be left here.
    for (Item& item : _items)
        if (item.holdsTransaction)
            STWTransaction::end();
}

void STWQueue::async(std::function<void()> work) {
    bool holds = _attributes.holdsTransactions;
    if (holds)
        STWTransaction::begin();
    STWLockGuard guard(_mutex);
    _items.push_back(Item{std::move(work), holds});
    if (!_draining && _suspendCount == 0)
        _lock_scheduleDrain();
}

void STWQueue::_lock_scheduleDrain() {
    _draining = true;
    pool(_attributes.priority).submit([self = shared_from_this()] { self->_drain(); });
}

void STWQueue::_runItem(Item& item) {
    try {
        item.work();
    } catch (const std::exception& e) {
        STW_FATAL("uncaught exception on queue %s: %s", _name, e.what());
    } catch (...) {
        STW_FATAL("uncaught exception on queue %s", _name);
    }
    item.work = nullptr;
    if (item.holdsTransaction)
        STWTransaction::end();
}

void STWQueue::_drain() {
    CurrentQueue current(this);
    for (int turn = 0;; ++turn) {
        Item item;
        {
            STWLockGuard guard(_mutex);
            if (_suspendCount > 0 || _items.empty()) {
                _draining = false;
                return;
            }
            if (turn == kItemsPerTurn) {
                _lock_scheduleDrain();
                return;
            }
            item = std::move(_items.front());
            _items.pop_front();
        }
        _runItem(item);
    }
}

void STWQueue::sync(const std::function<void()>& work) {
    if (isCurrent())
        STW_FATAL("synchronous submission to queue %s from its own thread would deadlock", _name);
    STWUniqueLock lock(_mutex);
    if (!_draining && _suspendCount == 0 && _items.empty()) {
        // Idle: run on the caller's thread, holding the queue as a drain would.
        _draining = true;
        lock.unlock();
        struct Release {
            STWQueue* queue;
            ~Release() {
                STWLockGuard guard(queue->_mutex);
                queue->_draining = false;
                if (!queue->_items.empty() && queue->_suspendCount == 0)
                    queue->_lock_scheduleDrain();
            }
        } release{this};
        CurrentQueue current(this);
        work();
        return;
    }
    std::mutex doneMutex;
    std::condition_variable doneCondition;
    bool done = false;
    std::exception_ptr failure;
    _items.push_back(Item{[&] {
                              try {
                                  work();
                              } catch (...) {
                                  failure = std::current_exception();
                              }
                              std::lock_guard guard(doneMutex);
                              done = true;
                              doneCondition.notify_one();
                          },
                          false});
    if (!_draining && _suspendCount == 0)
        _lock_scheduleDrain();
    lock.unlock();
    std::unique_lock doneLock(doneMutex);
    doneCondition.wait(doneLock, [&] { return done; });
    if (failure)
        std::rethrow_exception(failure);
}

void STWQueue::suspend() {
    STWLockGuard guard(_mutex);
    ++_suspendCount;
}

void STWQueue::resume() {
    STWLockGuard guard(_mutex);
    if (_suspendCount == 0)
        STW_FATAL("queue %s resumed more often than suspended", _name);
    if (--_suspendCount == 0 && !_draining && !_items.empty())
        _lock_scheduleDrain();
}

bool STWQueue::isSuspended() const {
    STWLockGuard guard(_mutex);
    return _suspendCount > 0;
}

bool STWQueue::isCurrent() const {
    return std::find(currentQueues.begin(), currentQueues.end(), this) != currentQueues.end();
}

void STWQueue::assertCurrent(const char* function) const {
    if (!isCurrent())
        STWLog::fatal(function, STWFormat("not running on queue %s", _name));
}
