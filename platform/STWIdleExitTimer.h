// Idle exit: the daemon leaves once it has had no connection and no open IPC transaction
// for a while, and the service manager starts it again when a client comes. Nothing
// ticks: the timer is armed for the end of the idle period whenever one may have begun
// (a connection closed, the last transaction ended) and turned off when it fires while
// there is work, so a busy daemon sees it at most once per idle period.
//
// STWDaemon makes one when it has an idle time; it lives on the event loop's thread.
#pragma once

#include "platform/STWEventLoop.h"

#include <chrono>

class STWIPCListener;

class STWIdleExitTimer {
public:
    // Ends `loop` with code 0 after `limit` without connections of `listener` or transactions.
    STWIdleExitTimer(STWEventLoop& loop, std::chrono::steady_clock::duration limit,
                     const STWIPCListener& listener);

    // Looks again whether the daemon is idle, and since when: call it when connections closed.
    void review();

private:
    STWEventLoop& _loop;
    const std::chrono::steady_clock::duration _limit;
    const STWIPCListener& _listener;
    STWEventLoop::Source _timer;
    STWEventLoop::Source _transactionsEnded;
};
