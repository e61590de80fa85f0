// Protection-class changes over the socket: a request that waits for the unlock is answered
// after it, and a daemon killed at each step of a change finishes it at its next start.
#include "tests/support/STWDaemonProcess.h"

#include "common/STWError.h"
#include "common/STWFileIO.h"
#include "platform/STWCrashPoint.h"

#include <gtest/gtest.h>

#include <fstream>
#include <future>
#include <sys/xattr.h>

namespace fs = std::filesystem;

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};
constexpr const char* kKey = "com.vorlane.Setwright.ContentProtectionClass";

int32_t classOf(const fs::path& item) {
    int32_t value = 0;
    return lgetxattr(item.c_str(), "trusted.stowly.protection-class", &value, sizeof value) == sizeof value ? value : 0;
}

uint64_t code(const STWValue::Dictionary& reply) { return STWDictionaryUInt64(reply, "ReplyError").value_or(0); }

STWValue::Dictionary protectionKeys(int64_t protectionClass, bool retry) {
    return {{"Identifier", STWValue("com.example.dp")},
            {"ContainerClass", STWValue(2u)},
            {"DataProtectionClass", STWValue(protectionClass)},
            {"RetryIfLocked", STWValue(retry)}};
}

// The container com.example.dp with Documents/note at class 3; its identity keys.
STWValue::Dictionary makeContainer(STWClient& client, fs::path* path) {
    auto reply = STWDaemonProcess::send(client, 0,
                                        {{"Identifier", STWValue("com.example.dp")},
                                         {"ContainerClass", STWValue(2u)},
                                         {"CreateIfNecessary", STWValue(true)}});
    const std::string* p = STWDictionaryString(reply, "ReplyPath");
    *path = p ? fs::path(*p) : fs::path();
    fs::create_directories(*path / "Documents");
    std::ofstream(*path / "Documents/note") << "kept";
    int32_t three = 3;
    lsetxattr((*path / "Documents/note").c_str(), "trusted.stowly.protection-class", &three, sizeof three, 0);
    return {{"Identifier", STWValue("com.example.dp")}, {"ContainerClass", STWValue(2u)}, {"UUID", reply["ReplyUUID"]}};
}

std::optional<int64_t> recordedClass(STWClient& client, STWValue::Dictionary identity) {
    identity["Key"] = STWValue(kKey);
    auto reply = STWDaemonProcess::send(client, 6, identity);
    auto found = reply.find("ReplyInfoValue");
    return found == reply.end() ? std::nullopt : found->second.int64Value();
}

size_t pendingFiles(const fs::path& root) {
    std::error_code ec;
    size_t n = 0;
    for (fs::directory_iterator it(root / "private/var/root/Library/Stowly/PendingUpdates", ec), end;
         !ec && it != end; it.increment(ec))
        ++n;
    return n;
}

void setKeybag(const fs::path& root, const char* state) {
    fs::create_directories(root / "run/stowly");
    ASSERT_EQ(STWWriteFileAtomically(root / "run/stowly/keybag", state, 0644, false), 0);
}

} // namespace

// While the device is locked the request gets no answer and its update file stays; the
// unlock reruns the change and the answer follows. Without retrying, a locked device is 61.
TEST(STWDataProtectionCommand, ALockedChangeIsAnsweredAfterTheUnlock) {
    STWDaemonProcess daemon({{"DeveloperMode", STWValue(true)}});
    auto client = daemon.connectAs("com.example.installer", allowed);
    ASSERT_NE(client, nullptr);
    fs::path container;
    auto identity = makeContainer(*client, &container);

    setKeybag(daemon.root(), "locked");
    std::this_thread::sleep_for(std::chrono::milliseconds(200)); // the watch suspends the lock-state queue
    EXPECT_EQ(code(STWDaemonProcess::send(*client, 21, protectionKeys(1, false))), STWErrorDeviceLocked);
    auto waiting = std::async(std::launch::async, [&] {
        STWValue::Dictionary message = protectionKeys(1, true);
        message["Command"] = STWValue(21u);
        return client->sendMessage(message, std::chrono::seconds(30), nullptr);
    });
    EXPECT_EQ(waiting.wait_for(std::chrono::milliseconds(500)), std::future_status::timeout);
    EXPECT_EQ(pendingFiles(daemon.root()), 1u);
    EXPECT_EQ(classOf(container / "Documents/note"), 3);

    setKeybag(daemon.root(), "unlocked");
    auto reply = waiting.get();
    ASSERT_TRUE(reply);
    EXPECT_EQ(code(*reply), STWErrorSuccess);
    EXPECT_EQ(classOf(container / "Documents/note"), 1);
    EXPECT_EQ(recordedClass(*client, identity), 1);
    EXPECT_EQ(pendingFiles(daemon.root()), 0u);
}

// Killed after the update file is written, after the walk and after the class is recorded:
// the next start finds the file and finishes the change, leaving the content as it was.
TEST(STWDataProtectionCrash, TheNextStartFinishesAChangeCutShort) {
    auto internal = STWValue::Dictionary{{"DeveloperMode", STWValue(true)}, {"InternalImage", STWValue(true)}};
    for (std::string_view point : STWCrashPoint::protection) {
        SCOPED_TRACE(std::string(point));
        STWDaemonProcess daemon(internal, {}, false);
        ASSERT_TRUE(daemon.startWith("STOWLY_CRASH_AT", std::string(point)));
        auto client = daemon.connectAs("com.example.installer", allowed);
        ASSERT_NE(client, nullptr);
        fs::path container;
        auto identity = makeContainer(*client, &container);
        STWValue::Dictionary message = protectionKeys(1, false);
        message["Command"] = STWValue(21u);
        client->sendMessage(message, std::chrono::seconds(5), nullptr);
        ASSERT_TRUE(daemon.killedItself());
        EXPECT_EQ(pendingFiles(daemon.root()), 1u);

        ASSERT_TRUE(daemon.start());
        client = daemon.connectAs("com.example.installer", allowed);
        EXPECT_EQ(recordedClass(*client, identity), 1);
        EXPECT_EQ(classOf(container / "Documents/note"), 1);
        EXPECT_EQ(classOf(container / "Documents"), 1);
        EXPECT_EQ(pendingFiles(daemon.root()), 0u);
        std::string text;
        EXPECT_EQ(STWReadFileContents(container / "Documents/note", &text, 0), 0);
        EXPECT_EQ(text, "kept");
    }
}
