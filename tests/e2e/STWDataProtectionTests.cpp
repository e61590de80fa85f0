// Protection-class changes that wait for the unlock or are cut short by a kill (the crash
// torture checks only that no update file is left and the recorded class is the data's).
#include "tests/e2e/STWE2ETestSupport.h"

#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <future>
#include <sys/xattr.h>

using namespace STWE2E;

namespace {

int32_t classOf(const fs::path& item) {
    int32_t value = 0;
    return lgetxattr(item.c_str(), "trusted.stowly.protection-class", &value, sizeof value) == sizeof value ? value : 0;
}

// A change of `identifier`'s data container to class 1.
STWValue::Dictionary protectionKeys(const std::string& identifier, bool retry) {
    return {{"Command", STWValue(21u)},
            {"Identifier", STWValue(identifier)},
            {"ContainerClass", STWValue(2u)},
            {"DataProtectionClass", STWValue(int64_t{1})},
            {"RetryIfLocked", STWValue(retry)}};
}

// `identifier`'s data container with Documents/note at class 3; its identity keys.
STWValue::Dictionary makeContainer(STWClient& client, const std::string& identifier, fs::path* container) {
    auto reply = STWDaemonProcess::send(client, 0, keys(identifier));
    *container = path(reply);
    write(*container / "Documents/note", "kept");
    int32_t three = 3;
    lsetxattr((*container / "Documents/note").c_str(), "trusted.stowly.protection-class", &three, sizeof three, 0);
    return {{"Identifier", STWValue(identifier)}, {"ContainerClass", STWValue(2u)}, {"UUID", reply["ReplyUUID"]}};
}

std::optional<int64_t> recordedClass(STWClient& client, STWValue::Dictionary identity) {
    identity["Key"] = STWValue("com.vorlane.Setwright.ContentProtectionClass");
    auto reply = STWDaemonProcess::send(client, 6, identity);
    auto found = reply.find("ReplyInfoValue");
    return found == reply.end() ? std::nullopt : found->second.int64Value();
}

void setKeybag(const fs::path& root, const char* state) {
    fs::create_directories(root / "run/stowly");
    ASSERT_EQ(STWWriteFileAtomically(root / "run/stowly/keybag", state, 0644, false), 0);
}

} // namespace

// A change waits for the unlock (without retrying, a locked device is 61) with its update file
// kept; a daemon killed at each step of a change finishes it at its next start, content intact.
TEST(STWDataProtection, ALockedOrInterruptedChangeIsFinishedLater) {
    STWDaemonProcess daemon(internal);
    Layout layout{daemon.root()};
    auto client = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    fs::path container;
    auto identity = makeContainer(*client, "com.example.locked", &container);
    setKeybag(daemon.root(), "locked");
    std::this_thread::sleep_for(std::chrono::milliseconds(200)); // the watch suspends the lock-state queue
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 21, protectionKeys("com.example.locked", false)),
              STWErrorDeviceLocked);
    auto waiting = std::async(std::launch::async, [&] {
        return client->sendMessage(protectionKeys("com.example.locked", true), std::chrono::seconds(30), nullptr);
    });
    EXPECT_EQ(waiting.wait_for(std::chrono::milliseconds(500)), std::future_status::timeout);
    EXPECT_EQ(names(layout.pendingUpdates()).size(), 1u);
    EXPECT_EQ(classOf(container / "Documents/note"), 3);
    setKeybag(daemon.root(), "unlocked");
    auto reply = waiting.get();
    ASSERT_TRUE(reply);
    EXPECT_EQ(code(*reply), STWErrorSuccess);
    EXPECT_EQ(classOf(container / "Documents/note"), 1);
    EXPECT_EQ(recordedClass(*client, identity), 1);
    EXPECT_EQ(names(layout.pendingUpdates()).size(), 0u);

    for (std::string_view view : STWCrashPoint::protection) {
        std::string point(view);
        SCOPED_TRACE(point);
        ASSERT_TRUE(daemon.stop());
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", point));
        client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        identity = makeContainer(*client, point, &container);
        client->sendMessage(protectionKeys(point, false), std::chrono::seconds(5), nullptr);
        ASSERT_TRUE(daemon.killedItself());
        EXPECT_EQ(names(layout.pendingUpdates()).size(), 1u);

        ASSERT_TRUE(daemon.start());
        client = daemon.connectAs("com.example.installer", allowed);
        EXPECT_EQ(recordedClass(*client, identity), 1);
        EXPECT_EQ(classOf(container / "Documents/note"), 1);
        EXPECT_EQ(classOf(container / "Documents"), 1);
        EXPECT_EQ(read(container / "Documents/note"), "kept");
    }
}
