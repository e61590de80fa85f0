#include "Daemon/STWLocks.h"
#include "tests/support/STWLockAttempt.h"

#include <gtest/gtest.h>

using namespace std::chrono_literals;

// The daemon-wide lock taken alone (who it waits for and whom it holds off) is driven
// through test locks 0 and 1 in the test-lock tests.
namespace {

TEST(STWLocks, ReadersShareAndOtherIdentifiersNeverWait) {
    lock_identifier_for_reading("A");
    STWLockAttempt secondReader = STWLockAttempt::lockAndUnlock("A", false);
    EXPECT_TRUE(secondReader.done(2000ms));
    STWLockAttempt otherWriter = STWLockAttempt::lockAndUnlock("B", true);
    EXPECT_TRUE(otherWriter.done(2000ms));
    STWLockAttempt sameWriter = STWLockAttempt::lockAndUnlock("A", true);
    EXPECT_FALSE(sameWriter.done());
    unlock_identifier("A");
    EXPECT_TRUE(sameWriter.done(2000ms));
    EXPECT_EQ(STWLocksCurrentState().lockRecordCount, 0u);
}

// Daemon-wide readers nest: while one of two still holds it, writers keep waiting.
TEST(STWLocks, DaemonWideReadersNest) {
    lock_all_identifiers_for_reading();
    lock_all_identifiers_for_reading();
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 2u);
    STWLockAttempt writer = STWLockAttempt::lockAndUnlock("A", true);
    unlock_all_identifiers();
    EXPECT_FALSE(writer.done());
    unlock_all_identifiers();
    EXPECT_TRUE(writer.done(2000ms));
}

TEST(STWLocks, ArraysAreLockedOnceInOrderAndRecordsGoWithTheLastHolder) {
    std::vector<std::string> ids{"C", "A", "B", "A"};
    lock_identifier_for_writing(ids);
    auto state = STWLocksCurrentState();
    EXPECT_EQ(state.identifierWriterCount, 3u);
    EXPECT_EQ(state.lockRecordCount, 3u);
    // Two lockers of overlapping sets in opposite orders never deadlock.
    STWLockAttempt other([] {
        lock_identifier_for_writing(std::vector<std::string>{"B", "A"});
        unlock_identifier(std::vector<std::string>{"A", "B"});
    });
    EXPECT_FALSE(other.done());
    unlock_identifier(ids);
    EXPECT_TRUE(other.done(2000ms));
    state = STWLocksCurrentState();
    EXPECT_EQ(state.identifierWriterCount, 0u);
    EXPECT_EQ(state.lockRecordCount, 0u);
}

TEST(STWLocksDeathTest, UnlockingWhatIsNotLockedStopsTheProcess) {
    EXPECT_DEATH(unlock_identifier("never-locked"), "invariant");
    EXPECT_DEATH(unlock_all_identifiers(), "invariant");
}

} // namespace
