// The commands one request queued, run in order when the request completes, stopping at
// the first failure. One per request (the dispatcher makes it) plus one for the daemon's
// own connection.
#pragma once

#include "common/STWThreadSafety.h"
#include "Daemon/Lifecycle/STWCommand.h"
#include "platform/STWQueue.h"

#include <deque>
#include <memory>
#include <mutex>

class STWCommandQueue : public std::enable_shared_from_this<STWCommandQueue> {
public:
    static std::shared_ptr<STWCommandQueue> init();

    // May be called from any thread, also by a running command.
    void insertCommand(STWCommandRef command);
    // Runs the oldest command. False with 77 when the queue is empty, false with the
    // command's code when it fails.
    bool executeNextCommandWithError(uint64_t* error);
    // Runs commands until the queue is exhausted (true, `error` untouched) or one fails
    // (false, its code stored); later commands stay queued.
    bool executeAllUntilExhaustedOrError(uint64_t* error);

    const std::shared_ptr<STWQueue>& queue() const { return _queue; }
    size_t count() const;

    STWCommandQueue();

private:
    std::shared_ptr<STWQueue> _queue;
    mutable STWMutex _commandsLock;
    std::deque<STWCommandRef> _commands STW_GUARDED_BY(_commandsLock);
};
