// Work run on a thread of its own, for the tests of who blocks whom at the identifier
// locks: done() tells whether it finished within a short wait, finish() waits for it.
#pragma once

#include "Daemon/STWLocks.h"

#include <chrono>
#include <functional>
#include <future>
#include <string>

class STWLockAttempt {
public:
    explicit STWLockAttempt(std::function<void()> work)
        : _future(std::async(std::launch::async, std::move(work))) {}
    bool done(std::chrono::milliseconds wait = std::chrono::milliseconds(150)) {
        return _future.wait_for(wait) == std::future_status::ready;
    }
    void finish() { _future.get(); }

    // Takes and drops the lock of `identifier` (for writing or for reading) on its thread.
    static STWLockAttempt lockAndUnlock(std::string identifier, bool write) {
        return STWLockAttempt([identifier, write] {
            write ? lock_identifier_for_writing(identifier) : lock_identifier_for_reading(identifier);
            unlock_identifier(identifier);
        });
    }

private:
    std::future<void> _future;
};
