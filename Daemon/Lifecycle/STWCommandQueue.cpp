#include "Daemon/Lifecycle/STWCommandQueue.h"

#include "common/STWError.h"
#include "common/STWLog.h"

std::shared_ptr<STWCommandQueue> STWCommandQueue::init() { return std::make_shared<STWCommandQueue>(); }

STWCommandQueue::STWCommandQueue() : _queue(STWQueue::create("com.vorlane.stowlyd.STWCommandQueue")) {}

void STWCommandQueue::insertCommand(STWCommandRef command) {
    uint64_t number = command->command();
    const void* address = command.get();
    {
        STWLockGuard guard(_commandsLock);
        _commands.push_back(std::move(command));
    }
    STW_LOG_INFO(STWLogCategory::Unspecified, "Added command <%p; %llu> to queue", address, number);
}

size_t STWCommandQueue::count() const {
    STWLockGuard guard(_commandsLock);
    return _commands.size();
}

bool STWCommandQueue::executeNextCommandWithError(uint64_t* error) {
    STWCommandRef command;
    {
        STWLockGuard guard(_commandsLock);
        if (_commands.empty()) {
            *error = STWErrorCommandQueueExhausted;
            return false;
        }
        command = std::move(_commands.front());
        _commands.pop_front();
    }
    uint64_t code = STWErrorSuccess;
    bool success = false;
    _queue->sync([&] {
        const void* address = command.get();
        STW_LOG_DEBUG(STWLogCategory::Unspecified, "Executing command <%p; %llu>...", address, command->command());
        success = command->fromQueue(*this, &code);
        STW_LOG_DEBUG(STWLogCategory::Unspecified, "Completed command <%p; %llu>: success = %d, error = %llu", address,
                      command->command(), success ? 1 : 0, code);
    });
    if (!success)
        *error = code;
    return success;
}

bool STWCommandQueue::executeAllUntilExhaustedOrError(uint64_t* error) {
    uint64_t code = STWErrorSuccess;
    while (executeNextCommandWithError(&code)) {
    }
    if (code == STWErrorCommandQueueExhausted)
        return true;
    *error = code;
    return false;
}
