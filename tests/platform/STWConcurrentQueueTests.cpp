#include "platform/STWConcurrentQueue.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <latch>
#include <semaphore>
#include <stdexcept>
#include <thread>

using namespace std::chrono_literals;

namespace {

TEST(STWConcurrentQueue, ItemsRunSideBySideAndABarrierRunsAlone) {
    auto queue = STWConcurrentQueue::create("test.barrier");
    // Ordinary items run side by side: both must be inside the queue at once for either to finish.
    std::latch both(2);
    auto inside = [&] {
        return std::async(std::launch::async, [&] { queue->sync([&] { both.arrive_and_wait(); }); });
    };
    auto first = inside(), second = inside();
    EXPECT_EQ(first.wait_for(2s), std::future_status::ready);
    EXPECT_EQ(second.wait_for(2s), std::future_status::ready);

    std::binary_semaphore earlierMayFinish(0), barrierMayFinish(0);
    std::atomic<bool> earlierRunning{false}, barrierRan{false}, barrierSawEarlierRunning{false};

    auto earlier = std::async(std::launch::async, [&] {
        queue->sync([&] {
            earlierRunning = true;
            earlierMayFinish.acquire();
            earlierRunning = false;
        });
    });
    while (!earlierRunning)
        std::this_thread::yield();
    queue->asyncBarrier([&] {
        barrierSawEarlierRunning = earlierRunning.load();
        barrierMayFinish.acquire();
        barrierRan = true;
    });
    std::atomic<bool> laterRan{false};
    auto later = std::async(std::launch::async, [&] { queue->sync([&] { laterRan = barrierRan.load(); }); });

    EXPECT_EQ(later.wait_for(150ms), std::future_status::timeout);
    earlierMayFinish.release();
    earlier.get();
    EXPECT_EQ(later.wait_for(150ms), std::future_status::timeout);
    barrierMayFinish.release();
    ASSERT_EQ(later.wait_for(2s), std::future_status::ready);
    EXPECT_TRUE(laterRan);
    EXPECT_FALSE(barrierSawEarlierRunning);
}

TEST(STWConcurrentQueue, BarriersRunInSubmissionOrderAndSyncExceptionsReachTheCaller) {
    auto queue = STWConcurrentQueue::create("test.barrier-order");
    std::vector<int> order; // barriers run alone, so no lock is needed
    for (int i = 0; i < 20; ++i)
        queue->asyncBarrier([&order, i] { order.push_back(i); });
    EXPECT_THROW(queue->sync([] { throw std::runtime_error("boom"); }), std::runtime_error);
    queue->sync([] {});
    ASSERT_EQ(order.size(), 20u);
    for (int i = 0; i < 20; ++i)
        EXPECT_EQ(order[i], i);
}

} // namespace
