// IPC transactions: a process-wide count of work in progress.
//
// The daemon exits when it has been idle for a while; an open transaction (a request being
// served, work posted to a background queue) keeps it alive. Idle exit waits on this count.
#pragma once

#include <chrono>
#include <cstdint>

class STWTransaction {
public:
    static void begin();
    static void end();
    static uint64_t count();
    // Time of the last begin or end: the start of the current idle period when count() is 0.
    static std::chrono::steady_clock::time_point lastChange();
    // Blocks until the count is 0 or `timeout` passes; true when it reached 0.
    static bool waitForIdle(std::chrono::steady_clock::duration timeout);
    // An eventfd that becomes readable whenever the count drops to 0, for the event loop to
    // time idle exit without polling; its one reader resets it. Lives as long as the process.
    static int idleEventFD();

    // Holds a transaction for its lifetime.
    class Scope {
    public:
        Scope() { begin(); }
        ~Scope() { end(); }
        Scope(const Scope&) = delete;
        Scope& operator=(const Scope&) = delete;
    };
};
