#include "Daemon/Lifecycle/STWTestLocks.h"
#include "Daemon/STWLocks.h"
#include "tests/support/STWLockAttempt.h"

#include <gtest/gtest.h>

using namespace std::chrono_literals;

namespace {

class STWTestLocksTest : public ::testing::Test {
protected:
    void SetUp() override {
        locks = STWTestLocks::sharedInstance();
        locks->setEnabled(true);
    }
    void TearDown() override {
        locks->releaseAllLocks();
        locks->setEnabled(false);
        STWLocksSnapshot state = STWLocksCurrentState();
        EXPECT_EQ(state.allReaderWriterState, 0u);
        EXPECT_EQ(state.identifierReaderCount, 0u);
        EXPECT_EQ(state.identifierWriterCount, 0u);
    }
    STWLockAttempt waiter(uint64_t lock) {
        return STWLockAttempt([this, lock] { EXPECT_TRUE(locks->waitOnLock(lock)); });
    }

    std::shared_ptr<STWTestLocks> locks;
};

TEST_F(STWTestLocksTest, ParkPointHoldsWaitersUntilItsLastReleaseRoundAfterRound) {
    ASSERT_TRUE(locks->acquireLock(2));
    ASSERT_TRUE(locks->acquireLock(2));
    STWLockAttempt first = waiter(2), second = waiter(2), otherPoint = waiter(3);
    EXPECT_TRUE(otherPoint.done(2000ms));
    EXPECT_FALSE(first.done());

    ASSERT_TRUE(locks->releaseLock(2));
    EXPECT_EQ(locks->countForLock(2), 1);
    EXPECT_FALSE(first.done());
    EXPECT_FALSE(second.done(0ms));

    ASSERT_TRUE(locks->releaseLock(2));
    EXPECT_TRUE(first.done(2000ms) && second.done(2000ms));

    // Later rounds carry nothing over, also when a round's barrier has not started by the
    // time the next is submitted.
    for (int round = 0; round < 50; ++round) {
        ASSERT_TRUE(locks->acquireLock(4));
        ASSERT_TRUE(locks->releaseLock(4));
    }
    ASSERT_TRUE(locks->acquireLock(4));
    STWLockAttempt parked = waiter(4);
    EXPECT_FALSE(parked.done(300ms));
    ASSERT_TRUE(locks->releaseLock(4));
    EXPECT_TRUE(parked.done(2000ms));
}

TEST_F(STWTestLocksTest, WaitersParkOnlyWhileEnabledAndDisablingReleasesEverything) {
    locks->setEnabled(false);
    ASSERT_TRUE(locks->acquireLock(2));
    STWLockAttempt unparked = waiter(2);
    EXPECT_TRUE(unparked.done(2000ms));

    locks->setEnabled(true);
    EXPECT_TRUE(locks->enabled());
    ASSERT_TRUE(locks->acquireLock(0));
    STWLockAttempt parked = waiter(2);
    EXPECT_FALSE(parked.done());
    STWLockAttempt writer = STWLockAttempt::lockAndUnlock("disable", true);
    EXPECT_FALSE(writer.done(0ms));

    locks->setEnabled(false);
    EXPECT_FALSE(locks->enabled());
    EXPECT_TRUE(parked.done(2000ms) && writer.done(2000ms));
    EXPECT_EQ(locks->countForLock(0) + locks->countForLock(2), 0);
}

// Lock 1 waits for the identifiers' holders, then holds off every locker until released.
TEST_F(STWTestLocksTest, WriteLockWaitsForHoldersThenHoldsOffEveryLockerUntilReleased) {
    lock_identifier_for_reading("held");
    // Taken on one thread, released on another: the hold belongs to the lock's count.
    STWLockAttempt acquire([this] { EXPECT_TRUE(locks->acquireLock(1)); });
    EXPECT_FALSE(acquire.done());
    unlock_identifier("held");
    ASSERT_TRUE(acquire.done(2000ms));
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 0xFFFFFFFFu);

    STWLockAttempt writer = STWLockAttempt::lockAndUnlock("container-A", true);
    STWLockAttempt reader = STWLockAttempt::lockAndUnlock("container-B", false);
    STWLockAttempt global([] {
        lock_all_identifiers_for_reading();
        unlock_all_identifiers();
    });
    EXPECT_FALSE(writer.done());
    EXPECT_FALSE(reader.done(0ms) || global.done(0ms));

    ASSERT_TRUE(locks->releaseLock(1));
    EXPECT_TRUE(writer.done(2000ms) && reader.done(2000ms) && global.done(2000ms));
}

TEST_F(STWTestLocksTest, ReadLockAdmitsReadersHoldsOffIdentifierWritersAndRefusesTheWriteLock) {
    ASSERT_TRUE(locks->acquireLock(0));
    ASSERT_TRUE(locks->acquireLock(0)); // only counts
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 1u);
    EXPECT_TRUE(STWLockAttempt::lockAndUnlock("container-A", false).done(2000ms));
    STWLockAttempt writer = STWLockAttempt::lockAndUnlock("container-A", true);
    EXPECT_FALSE(writer.done());
    // Lock 1 would wait for lock 0 for ever on the state queue; it is refused instead.
    STWLockAttempt write([this] { EXPECT_FALSE(locks->acquireLock(1)); });
    EXPECT_TRUE(write.done(2000ms));
    EXPECT_EQ(locks->countForLock(1), 0);

    ASSERT_TRUE(locks->releaseLock(0));
    EXPECT_FALSE(writer.done());
    ASSERT_TRUE(locks->releaseLock(0));
    EXPECT_TRUE(writer.done(2000ms));
}

TEST_F(STWTestLocksTest, UnbalancedReleasesAndUnknownLocksAreRefusedReleaseAllIsNot) {
    EXPECT_FALSE(locks->acquireLock(6));
    EXPECT_FALSE(locks->releaseLock(6));
    EXPECT_FALSE(locks->waitOnLock(6));
    // Were these taken, unlocking a daemon-wide lock nobody holds would stop the process.
    EXPECT_FALSE(locks->releaseLock(0));
    EXPECT_FALSE(locks->releaseLock(1));
    EXPECT_FALSE(locks->releaseLock(3));
    EXPECT_EQ(locks->countForLock(3), 0);

    ASSERT_TRUE(locks->acquireLock(3));
    ASSERT_TRUE(locks->releaseLock(3));
    EXPECT_FALSE(locks->releaseLock(3));

    ASSERT_TRUE(locks->acquireLock(1));
    // Refused at once, not parked behind the write lock.
    STWLockAttempt refused([this] {
        EXPECT_FALSE(locks->waitOnLock(0));
        EXPECT_FALSE(locks->waitOnLock(1));
    });
    EXPECT_TRUE(refused.done(2000ms));
    ASSERT_TRUE(locks->releaseLock(1));
    EXPECT_FALSE(locks->releaseLock(1));
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 0u);

    // Releasing all lets every held lock go at once.
    for (uint64_t lock : {0, 0, 2, 5, 5, 5})
        ASSERT_TRUE(locks->acquireLock(lock));
    STWLockAttempt parkedAt2 = waiter(2), parkedAt5 = waiter(5);
    STWLockAttempt writer = STWLockAttempt::lockAndUnlock("container-A", true);
    EXPECT_FALSE(parkedAt2.done());
    EXPECT_FALSE(parkedAt5.done(0ms) || writer.done(0ms));

    locks->releaseAllLocks();
    EXPECT_TRUE(parkedAt2.done(2000ms) && parkedAt5.done(2000ms) && writer.done(2000ms));
    for (uint64_t lock = 0; lock < STWTestLocks::lockCount; ++lock)
        EXPECT_EQ(locks->countForLock(lock), 0) << lock;
    EXPECT_FALSE(locks->releaseLock(0));
    EXPECT_TRUE(locks->enabled());
}

} // namespace

// While test lock 1 waits for the daemon-wide lock, every other request to the test locks
// gets in, its own release included; the lock it then gets is let go at once.
TEST_F(STWTestLocksTest, WaitingForTheDaemonWideLockBlocksNoOtherRequest) {
    lock_all_identifiers_for_reading(); // a request that holds the daemon-wide lock
    STWLockAttempt taker([&] { EXPECT_TRUE(locks->acquireLock(STWTestLocks::daemonWideWriteLock)); });
    EXPECT_FALSE(taker.done());
    STWLockAttempt others([&] {
        EXPECT_TRUE(locks->acquireLock(3));
        EXPECT_TRUE(locks->releaseLock(3));
        EXPECT_TRUE(locks->releaseLock(STWTestLocks::daemonWideWriteLock));
    });
    EXPECT_TRUE(others.done(2000ms));
    unlock_all_identifiers();
    EXPECT_TRUE(taker.done(2000ms));
    EXPECT_EQ(locks->countForLock(STWTestLocks::daemonWideWriteLock), 0);
}
