#include "platform/STWIdleExitTimer.h"

#include "common/STWLog.h"
#include "platform/STWIPCListener.h"
#include "platform/STWTransaction.h"

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <unistd.h>

STWIdleExitTimer::STWIdleExitTimer(STWEventLoop& loop, std::chrono::steady_clock::duration limit,
                                   const STWIPCListener& listener)
    : _loop(loop), _limit(limit), _listener(listener) {
    _timer = loop.timer([this] { review(); });
    _transactionsEnded = loop.watchReadable(STWTransaction::idleEventFD(), [this] {
        uint64_t count;
        while (read(STWTransaction::idleEventFD(), &count, sizeof count) < 0 && errno == EINTR) {
        }
        review();
    });
    if (!_timer || !_transactionsEnded)
        STW_LOG_ERROR(STWLogCategory::Startup, "Cannot time idle exit: %s", strerror(errno));
    review();
}

void STWIdleExitTimer::review() {
    // The end of the work there is wakes the loop again: a connection's close calls this,
    // and the end of the last transaction is asked to be told.
    if (_listener.connectionCount() != 0 || STWTransaction::notifyWhenIdle()) {
        _timer.disarm();
        return;
    }
    auto idleSince = std::max(_listener.lastConnectionChange(), STWTransaction::lastChange());
    if (std::chrono::steady_clock::now() - idleSince < _limit) {
        _timer.armAt(idleSince + _limit);
        return;
    }
    STW_LOG_NOTICE(STWLogCategory::Startup, "Exiting after %.0f idle seconds",
                   std::chrono::duration<double>(_limit).count());
    _loop.exit(0);
}
