// The bytes that frame readers may hold, between them, for frames still arriving.
//
// A reader of the request socket keeps one small chunk of its own; before it grows its
// buffer for a larger frame it reserves the extra bytes here, and it gives them back when
// the frame is done or the connection ends. Peers that each announce a large frame can so
// make the daemon hold no more than the limit between them; the one that finds the
// budget spent is dropped. The listener owns the budget of its connections (the daemon
// has one listener, so this bounds the whole process). Safe from any thread.
#pragma once

#include <atomic>
#include <cstddef>

class STWIPCFrameBudget {
public:
    explicit STWIPCFrameBudget(size_t limit) : _limit(limit) {}
    STWIPCFrameBudget(const STWIPCFrameBudget&) = delete;
    STWIPCFrameBudget& operator=(const STWIPCFrameBudget&) = delete;

    // Takes `bytes` from the budget; false, taking nothing, when fewer are left.
    bool reserve(size_t bytes);
    // Gives back bytes taken by reserve().
    void release(size_t bytes);

    size_t limit() const { return _limit; }
    size_t reserved() const { return _reserved.load(); }

private:
    const size_t _limit;
    std::atomic<size_t> _reserved{0};
};
