#include "Daemon/Request/STWDaemon.h"
#include "platform/STWKeybag.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <atomic>

// The lock-state queue follows the keybag: suspended exactly while the device is
// locked, however often the same state is reported.
TEST(STWLockState, SuspendAndResumeAlternateWithTheDeviceState) {
    STWTestRoot::shared();
    auto queue = STWDaemon::lockStateQueue();
    EXPECT_EQ(STWDaemon::storedLockState(), 3);

    STWKeybag::setLockStateOverrideForTesting(false);
    STWDaemon::keybag_notification_callback();
    EXPECT_FALSE(queue->isSuspended()); // the first "unlocked" resumes nothing
    EXPECT_EQ(STWDaemon::storedLockState(), 0);

    STWKeybag::setLockStateOverrideForTesting(true);
    STWDaemon::keybag_notification_callback();
    STWDaemon::keybag_notification_callback();
    EXPECT_TRUE(queue->isSuspended());
    std::atomic<bool> ran{false};
    queue->async([&] { ran = true; });

    STWKeybag::setLockStateOverrideForTesting(false);
    STWDaemon::keybag_notification_callback();
    EXPECT_FALSE(queue->isSuspended()); // one resume undoes the one suspend
    queue->sync([] {});
    EXPECT_TRUE(ran);
    STWDaemon::keybag_notification_callback();
    EXPECT_FALSE(queue->isSuspended());
    STWKeybag::setLockStateOverrideForTesting(std::nullopt);
}
