#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "common/STWError.h"

#include <gtest/gtest.h>

#include <vector>

namespace {

// Records its run and answers as told; may queue a follow-up while it runs.
class RecordingCommand : public STWCommand {
public:
    RecordingCommand(std::vector<int>& log, int tag, uint64_t failWith = 0, STWCommandRef followUp = nullptr)
        : _log(log), _tag(tag), _failWith(failWith), _followUp(std::move(followUp)) {}
    uint64_t command() const override { return 3; }
    bool fromQueue(STWCommandQueue& queue, uint64_t* error) override {
        EXPECT_TRUE(queue.queue()->isCurrent());
        _log.push_back(_tag);
        if (_followUp)
            queue.insertCommand(_followUp);
        if (_failWith) {
            *error = _failWith;
            return false;
        }
        return true;
    }

private:
    std::vector<int>& _log;
    int _tag;
    uint64_t _failWith;
    STWCommandRef _followUp;
};

} // namespace

// In order, commands queued by a running one included; the first failure stops the run and
// keeps the rest; success leaves the caller's code alone.
TEST(STWCommandQueue, RunsInOrderAndStopsAtTheFirstFailure) {
    std::vector<int> log;
    auto queue = STWCommandQueue::init();
    queue->insertCommand(std::make_shared<RecordingCommand>(log, 1, 0, std::make_shared<RecordingCommand>(log, 3)));
    queue->insertCommand(std::make_shared<RecordingCommand>(log, 2));
    uint64_t error = 1;
    EXPECT_TRUE(queue->executeAllUntilExhaustedOrError(&error));
    EXPECT_EQ(error, 1u);
    EXPECT_EQ(log, (std::vector<int>{1, 2, 3}));
    EXPECT_FALSE(queue->executeNextCommandWithError(&error));
    EXPECT_EQ(error, STWErrorCommandQueueExhausted);

    queue->insertCommand(std::make_shared<RecordingCommand>(log, 4, STWErrorCacheRemoveFailed));
    queue->insertCommand(std::make_shared<RecordingCommand>(log, 5));
    EXPECT_FALSE(queue->executeAllUntilExhaustedOrError(&error));
    EXPECT_EQ(error, STWErrorCacheRemoveFailed);
    EXPECT_EQ(log, (std::vector<int>{1, 2, 3, 4}));
    EXPECT_EQ(queue->count(), 1u);
}
