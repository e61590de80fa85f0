#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Request/STWDaemon.h"
#include "common/STWFileIO.h"
#include "platform/STWFilePersonaService.h"
#include "platform/STWKeybag.h"
#include "platform/STWPlatformConfiguration.h"
#include "tests/support/STWEventLoopThread.h"
#include "tests/support/STWTestRoot.h"

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <fcntl.h>
#include <fstream>
#include <thread>
#include <unistd.h>

// The lock-state queue follows the keybag: suspended exactly while the device is
// locked, however often the same state is reported.
TEST(STWLockState, SuspendAndResumeAlternateWithTheDeviceState) {
    STWTestRoot::shared();
    auto queue = STWDaemonQueues::lockState();
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

// The kernel queues only so many file events and then drops them, so the device may lock
// unseen. The overflow it reports instead makes every watch read its file again: the lock
// is noticed, and the persona list, whose directory saw nothing, is read again too.
TEST(STWLockState, ALockLostInAnInotifyOverflowIsStillNoticed) {
    STWTestRoot::shared();
    std::filesystem::path runtime = STWPlatformConfiguration::sharedInstance()->runtimeDirectory();
    std::filesystem::create_directories(runtime);
    ASSERT_TRUE(STWKeybag::registerForLockStateNotifications(STWDaemon::keybag_notification_callback));
    STWDaemon::keybag_notification_callback();
    ASSERT_EQ(STWDaemon::storedLockState(), STWKeybagUnlocked);
    std::atomic<int> personaUpdates{0};
    STWFilePersonaService personas;
    int token = personas.registerForPersonaListUpdates(
        "test", [&] { ++personaUpdates; }, [](STWErrorRef) {});
    ASSERT_GE(token, 0);

    // Three events per round (created, written, removed) while nothing reads them; the
    // lock comes once the queue is full.
    int limit = 0;
    std::ifstream("/proc/sys/fs/inotify/max_queued_events") >> limit;
    if (limit <= 0 || limit > (1 << 20))
        GTEST_SKIP() << "inotify queues " << limit << " events";
    std::string churn = runtime / "churn";
    for (int i = 0; i <= limit / 2; i++) {
        close(open(churn.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
        unlink(churn.c_str());
    }
    ASSERT_EQ(STWWriteFile(runtime / "keybag", "locked", 0644, false), 0);
    {
        STWEventLoopThread loop;
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
        while ((STWDaemon::storedLockState() != STWKeybagLocked || personaUpdates == 0) &&
               std::chrono::steady_clock::now() < deadline)
            std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    EXPECT_EQ(STWDaemon::storedLockState(), STWKeybagLocked);
    EXPECT_TRUE(STWDaemonQueues::lockState()->isSuspended());
    EXPECT_GT(personaUpdates.load(), 0);
    personas.unregisterForPersonaListUpdates(token);
}
