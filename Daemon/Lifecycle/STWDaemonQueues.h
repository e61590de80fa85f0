// The daemon's shared serial queues, created once and kept for the process. Start-up, the
// request operations and (later) data protection submit to them; none of them is the
// daemon's to own, so they live here rather than with the entry point.
#pragma once

#include "platform/STWQueue.h"

#include <memory>

class STWDaemonQueues {
public:
    // "com.vorlane.stowlyd.deathrow": deletion passes over death row, at background
    // priority; each pass holds an IPC transaction until it ran.
    static const std::shared_ptr<STWQueue>& deathRow();
    // "com.vorlane.stowlyd.lockstate": suspended while the device is locked, so work on it
    // waits for the next unlock. Only ever submitted to asynchronously.
    static const std::shared_ptr<STWQueue>& lockState();
};
