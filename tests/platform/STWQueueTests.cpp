#include "platform/STWQueue.h"
#include "platform/STWTransaction.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <stdexcept>
#include <thread>
#include <unistd.h>
#include <vector>

using namespace std::chrono_literals;

namespace {

TEST(STWQueue, RunsItemsOneAtATimeInSubmissionOrderAlsoWithSyncFromManyThreads) {
    auto queue = STWQueue::create("test.order");
    std::vector<int> seen; // only touched on the queue
    std::atomic<int> running{0};
    bool overlapped = false;
    for (int i = 0; i < 500; ++i) {
        queue->async([&, i] {
            if (running.fetch_add(1) != 0)
                overlapped = true;
            seen.push_back(i);
            running.fetch_sub(1);
        });
    }
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t)
        threads.emplace_back([&] {
            for (int i = 0; i < 200; ++i) {
                auto item = [&] { seen.push_back(-1); };
                i % 2 ? queue->async(item) : queue->sync(item);
            }
        });
    for (auto& t : threads)
        t.join();
    queue->sync([] {});
    ASSERT_EQ(seen.size(), 500u + 1600u);
    for (int i = 0; i < 500; ++i)
        ASSERT_EQ(seen[i], i);
    EXPECT_FALSE(overlapped);
}

// Suspensions nest, and one taken while an item runs holds back only the items after it.
TEST(STWQueue, SuspendedQueueRunsNothingUntilResumed) {
    auto queue = STWQueue::create("test.suspend");
    std::promise<void> started, release;
    auto releaseFuture = release.get_future().share();
    std::atomic<int> ran{0};
    queue->async([&] {
        started.set_value();
        releaseFuture.wait();
        ++ran;
    });
    queue->async([&] { ++ran; });
    started.get_future().wait();
    queue->suspend();
    queue->suspend();
    release.set_value();
    auto waiter = std::async(std::launch::async, [&] { queue->sync([&] { ++ran; }); });
    EXPECT_EQ(waiter.wait_for(100ms), std::future_status::timeout);
    queue->resume();
    EXPECT_EQ(waiter.wait_for(100ms), std::future_status::timeout); // still suspended once
    EXPECT_EQ(ran.load(), 1);
    queue->resume();
    waiter.get();
    EXPECT_EQ(ran.load(), 3);
    EXPECT_FALSE(queue->isSuspended());
}

TEST(STWQueue, KnowsWhichQueueIsCurrentAndPassesExceptionsToSyncCallers) {
    auto a = STWQueue::create("test.a");
    auto b = STWQueue::create("test.b");
    EXPECT_FALSE(a->isCurrent());
    a->sync([&] {
        EXPECT_TRUE(a->isCurrent());
        b->sync([&] {
            EXPECT_TRUE(a->isCurrent());
            EXPECT_TRUE(b->isCurrent());
        });
    });
    std::promise<bool> onQueue;
    a->async([&] { onQueue.set_value(a->isCurrent() && !b->isCurrent()); });
    EXPECT_TRUE(onQueue.get_future().get());
    EXPECT_THROW(a->sync([] { throw std::runtime_error("boom"); }), std::runtime_error);
    EXPECT_EQ(a->syncResult([] { return 7; }), 7); // the queue survived the exception
}

TEST(STWQueue, TransactionsAreHeldFromSubmissionUntilTheWorkRan) {
    ASSERT_TRUE(STWTransaction::waitForIdle(5s));
    auto queue = STWQueue::create("test.transactions", {STWQueue::Priority::Background, true});
    queue->suspend();
    queue->async([] {});
    queue->async([] {});
    EXPECT_EQ(STWTransaction::count(), 2u);
    EXPECT_FALSE(STWTransaction::waitForIdle(20ms));
    queue->resume();
    EXPECT_TRUE(STWTransaction::waitForIdle(5s));
    {
        STWTransaction::Scope scope;
        EXPECT_EQ(STWTransaction::count(), 1u);
    }
    EXPECT_EQ(STWTransaction::count(), 0u);

    // The idle descriptor is written once, for the end that was asked to be told of.
    auto drained = [] {
        uint64_t value;
        return read(STWTransaction::idleEventFD(), &value, sizeof value) == sizeof value;
    };
    drained();
    EXPECT_FALSE(STWTransaction::notifyWhenIdle()); // idle already
    { STWTransaction::Scope unasked; }
    EXPECT_FALSE(drained());
    {
        STWTransaction::Scope asked;
        EXPECT_TRUE(STWTransaction::notifyWhenIdle());
    }
    EXPECT_TRUE(drained());
    { STWTransaction::Scope unaskedAgain; }
    EXPECT_FALSE(drained());
}

TEST(STWQueueDeathTest, SyncFromTheQueuesOwnThreadIsDetected) {
    EXPECT_DEATH(
        {
            auto queue = STWQueue::create("test.self");
            queue->sync([&] { queue->sync([] {}); });
        },
        "synchronous submission to queue test.self from its own thread");
    EXPECT_DEATH(
        {
            auto queue = STWQueue::create("test.assert");
            queue->assertCurrent("caller");
        },
        "not running on queue test.assert");
    EXPECT_DEATH(STWQueue::create("test.resume")->resume(), "resumed more often than suspended");
}

} // namespace
