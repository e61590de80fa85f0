#include "platform/STWTransaction.h"

#include "common/STWFileDescriptor.h"
#include "common/STWLog.h"

#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <mutex>
#include <sys/eventfd.h>
#include <unistd.h>
#include <utility>

namespace {

struct State {
    std::mutex mutex;
    std::condition_variable changed;
    uint64_t count = 0;
    bool idleWanted = false; // notifyWhenIdle() asked, and the count has not dropped to 0 since
    std::chrono::steady_clock::time_point lastChange = std::chrono::steady_clock::now();
    const STWFileDescriptor idleFD{eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
};

State& state() {
    static State* s = new State; // used by detached worker threads up to process exit
    return *s;
}

} // namespace

void STWTransaction::begin() {
    State& s = state();
    std::lock_guard guard(s.mutex);
    ++s.count;
    s.lastChange = std::chrono::steady_clock::now();
}

void STWTransaction::end() {
    State& s = state();
    {
        std::lock_guard guard(s.mutex);
        if (s.count == 0)
            STW_FATAL("transaction ended that was never begun");
        --s.count;
        s.lastChange = std::chrono::steady_clock::now();
        if (s.count != 0)
            return;
        s.changed.notify_all();
        if (!std::exchange(s.idleWanted, false))
            return;
    }
    uint64_t one = 1;
    if (s.idleFD && write(s.idleFD.get(), &one, sizeof one) != sizeof one)
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Cannot report the end of the last transaction: %s",
                      strerror(errno));
}

uint64_t STWTransaction::count() {
    State& s = state();
    std::lock_guard guard(s.mutex);
    return s.count;
}

std::chrono::steady_clock::time_point STWTransaction::lastChange() {
    State& s = state();
    std::lock_guard guard(s.mutex);
    return s.lastChange;
}

int STWTransaction::idleEventFD() { return state().idleFD.get(); }

bool STWTransaction::notifyWhenIdle() {
    State& s = state();
    std::lock_guard guard(s.mutex);
    if (s.count == 0)
        return false;
    s.idleWanted = true;
    return true;
}

bool STWTransaction::waitForIdle(std::chrono::steady_clock::duration timeout) {
    State& s = state();
    std::unique_lock lock(s.mutex);
    return s.changed.wait_for(lock, timeout, [&] { return s.count == 0; });
}
