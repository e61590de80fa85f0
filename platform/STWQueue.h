// Serial queues: the daemon's unit of ordering.
//
// Work submitted to one queue runs one item at a time, in submission order, on threads of
// a shared pool (one per priority) that grows when its threads block, up to a bound. A suspended queue runs nothing until
// resumed. Synchronous submission runs the work on the caller's thread when the queue is
// idle, and otherwise waits for its turn; submitting synchronously to the queue the caller
// is already running on would deadlock and is stopped as a programming error.
#pragma once

#include "common/STWThreadSafety.h"

#include <condition_variable>
#include <deque>
#include <exception>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <type_traits>

class STWQueue : public std::enable_shared_from_this<STWQueue> {
public:
    // Background work runs at the lowest scheduling priority; user-initiated work (a
    // process waiting to launch) above the default.
    enum class Priority { Default, Background, UserInitiated };
    struct Attributes {
        Priority priority = Priority::Default;
        // Each submitted item holds an IPC transaction from submission until it has run,
        // so idle exit never drops posted work.
        bool holdsTransactions = false;
    };

    static std::shared_ptr<STWQueue> create(std::string name, Attributes attributes);
    static std::shared_ptr<STWQueue> create(std::string name) {
        return create(std::move(name), Attributes{});
    }

    const std::string& name() const { return _name; }

    void async(std::function<void()> work);
    // Exceptions thrown by `work` reach the caller.
    void sync(const std::function<void()>& work);
    template <class F>
    auto syncResult(F&& f) -> std::invoke_result_t<F&> {
        using R = std::invoke_result_t<F&>;
        if constexpr (std::is_void_v<R>) {
            sync(f);
        } else {
            std::optional<R> result;
            sync([&] { result.emplace(f()); });
            return std::move(*result);
        }
    }

    // Suspensions nest; the item running at the time finishes first.
    void suspend();
    void resume();
    bool isSuspended() const;

    // True when the calling thread is running work of this queue (directly or through
    // a synchronous submission further down its stack).
    bool isCurrent() const;
    // Stops the process when the caller is not running on this queue.
    void assertCurrent(const char* function) const;

    ~STWQueue();
    STWQueue(const STWQueue&) = delete;
    STWQueue& operator=(const STWQueue&) = delete;

private:
    struct Tag {};

public:
    STWQueue(Tag, std::string name, Attributes attributes);

private:
    struct Item {
        std::function<void()> work;
        bool holdsTransaction;
    };

    void _lock_scheduleDrain() STW_REQUIRES(_mutex);
    void _drain();
    void _runItem(Item& item);

    const std::string _name;
    const Attributes _attributes;
    mutable STWMutex _mutex;
    std::deque<Item> _items STW_GUARDED_BY(_mutex);
    bool _draining STW_GUARDED_BY(_mutex) = false;
    unsigned _suspendCount STW_GUARDED_BY(_mutex) = 0;
};
