#include "Daemon/Lifecycle/STWDaemonQueues.h"

const std::shared_ptr<STWQueue>& STWDaemonQueues::deathRow() {
    static const auto* queue = new std::shared_ptr<STWQueue>(STWQueue::create(
        "com.vorlane.stowlyd.deathrow", {.priority = STWQueue::Priority::Background, .holdsTransactions = true}));
    return *queue;
}

const std::shared_ptr<STWQueue>& STWDaemonQueues::lockState() {
    static const auto* queue = new std::shared_ptr<STWQueue>(STWQueue::create(
        "com.vorlane.stowlyd.lockstate", {.priority = STWQueue::Priority::Default, .holdsTransactions = true}));
    return *queue;
}
