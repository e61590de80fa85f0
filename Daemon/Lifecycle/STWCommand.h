// A deferred step of a request: operations queue commands on the request's command
// queue, and they run in order when the request completes (a stage-for-delete, a
// code-signing clean-up), so that one request's side effects happen together and after
// its own work.
#pragma once

#include <cstdint>
#include <memory>

class STWCommandQueue;

class STWCommand {
public:
    virtual ~STWCommand() = default;
    // The command number of its kind.
    virtual uint64_t command() const = 0;
    // Runs on `queue`'s serial queue. Answers false and writes `error` on failure.
    virtual bool fromQueue(STWCommandQueue& queue, uint64_t* error) = 0;
};
using STWCommandRef = std::shared_ptr<STWCommand>;
