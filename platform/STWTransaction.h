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
    // An eventfd that becomes readable when the count drops to 0 after notifyWhenIdle(),
    // for the event loop to time idle exit without polling; its one reader resets it. Lives
    // as long as the process.
    static int idleEventFD();
    // Asks for idleEventFD() to become readable the next time the count drops to 0; false
    // (nothing asked) when it is 0 already. Only a waiting reader is told, so that a busy
    // daemon does not write to the descriptor at the end of every request and upcall.
    static bool notifyWhenIdle();

    // Holds a transaction for its lifetime.
    class Scope {
    public:
        Scope() { begin(); }
        ~Scope() { end(); }
        Scope(const Scope&) = delete;
        Scope& operator=(const Scope&) = delete;
    };
};
