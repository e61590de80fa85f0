#include "Daemon/STWLocks.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

using namespace std::chrono_literals;

namespace {

// Runs `work` on another thread; `done()` tells whether it finished within a short wait.
class Attempt {
public:
    explicit Attempt(std::function<void()> work) : _future(std::async(std::launch::async, std::move(work))) {}
    bool done(std::chrono::milliseconds wait = 100ms) {
        return _future.wait_for(wait) == std::future_status::ready;
    }
    void finish() { _future.get(); }

private:
    std::future<void> _future;
};

// Takes and drops the lock of `id` on another thread.
Attempt lockAndUnlock(std::string id, bool write) {
    return Attempt([id, write] {
        write ? lock_identifier_for_writing(id) : lock_identifier_for_reading(id);
        unlock_identifier(id);
    });
}

} // namespace

TEST(STWLocks, ReadersShareAndOtherIdentifiersNeverWait) {
    lock_identifier_for_reading("A");
    Attempt secondReader = lockAndUnlock("A", false);
    EXPECT_TRUE(secondReader.done(2000ms));
    Attempt otherWriter = lockAndUnlock("B", true);
    EXPECT_TRUE(otherWriter.done(2000ms));
    Attempt sameWriter = lockAndUnlock("A", true);
    EXPECT_FALSE(sameWriter.done());
    unlock_identifier("A");
    EXPECT_TRUE(sameWriter.done(2000ms));
    EXPECT_EQ(STWLocksCurrentState().lockRecordCount, 0u);
}

TEST(STWLocks, GlobalWriterWaitsForHoldersAndThenBlocksNewOnes) {
    lock_identifier_for_reading("A");
    std::atomic<bool> globalHeld{false};
    Attempt global([&] {
        lock_all_identifiers_for_writing();
        globalHeld = true;
        std::this_thread::sleep_for(200ms);
        globalHeld = false;
        unlock_all_identifiers();
    });
    EXPECT_FALSE(global.done());
    EXPECT_FALSE(globalHeld);
    unlock_identifier("A");
    while (!globalHeld)
        std::this_thread::yield();
    // While the writer holds everything, a new reader of any identifier waits for it.
    std::atomic<bool> readerSawGlobal{true};
    Attempt reader([&] {
        lock_identifier_for_reading("C");
        readerSawGlobal = globalHeld.load();
        unlock_identifier("C");
    });
    EXPECT_FALSE(reader.done(50ms));
    global.finish();
    reader.finish();
    EXPECT_FALSE(readerSawGlobal);
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 0u);
}

TEST(STWLocks, GlobalReadersAdmitIdentifierReadersButNotWriters) {
    lock_all_identifiers_for_reading();
    lock_all_identifiers_for_reading();
    EXPECT_EQ(STWLocksCurrentState().allReaderWriterState, 2u);
    Attempt reader = lockAndUnlock("A", false);
    EXPECT_TRUE(reader.done(2000ms));
    Attempt writer = lockAndUnlock("A", true);
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
    Attempt other([] {
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
