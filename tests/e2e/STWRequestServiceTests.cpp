#include "tests/support/STWDaemonProcess.h"

#include "common/STWDictionaryUtilities.h"
#include "common/STWError.h"
#include "common/STWMessagePack.h"
#include "common/STWIPCFrame.h"
#include "platform/STWIPCListener.h"

#include <gtest/gtest.h>

#include <atomic>
#include <set>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace {

const STWValue::Dictionary allowed{{"com.vorlane.private.Stowly.allowed", STWValue(true)}};

// Commands whose reply is not "not entitled": the caller got a connection (the command
// itself may still be unsupported in this build).
std::set<uint64_t> connectedCommands(STWClient& client) {
    std::set<uint64_t> commands;
    for (uint64_t c = 0; c < 32; c++) {
        // A caller's own system container is refused (55) to one without the entitlement;
        // a well-known one is anyone's.
        STWValue::Dictionary keys;
        if (c == 15)
            keys["Identifier"] = STWValue("com.vorlane.maple");
        uint64_t code = STWDaemonProcess::replyError(client, c, keys);
        EXPECT_NE(code, 0u) << "no reply to command " << c;
        if (code != STWErrorNotEntitled)
            commands.insert(c);
    }
    return commands;
}

std::string lengthPrefixed(std::string_view payload) {
    uint32_t n = static_cast<uint32_t>(payload.size());
    std::string frame{static_cast<char>(n), static_cast<char>(n >> 8), static_cast<char>(n >> 16),
                      static_cast<char>(n >> 24)};
    return frame + std::string(payload);
}

class STWRequestServiceTest : public ::testing::Test {
protected:
    static void SetUpTestSuite() { daemon = new STWDaemonProcess({{"DeveloperMode", STWValue(true)}}); }
    static void TearDownTestSuite() {
        delete daemon;
        daemon = nullptr;
    }
    static STWDaemonProcess* daemon;
};
STWDaemonProcess* STWRequestServiceTest::daemon = nullptr;

} // namespace

TEST_F(STWRequestServiceTest, CommandNumbersOutsideTheTableAreUnsupported) {
    auto client = daemon->connectAs("com.example.allowed", allowed);
    ASSERT_NE(client, nullptr);
    for (uint64_t command : {uint64_t{32}, uint64_t{1} << 63, UINT64_MAX})
        EXPECT_EQ(STWDaemonProcess::replyError(*client, command), STWErrorUnsupportedCommand) << command;
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 27), STWErrorUnsupportedCommand);
}

TEST_F(STWRequestServiceTest, EntitlementsDecideWhichCommandsGetAConnection) {
    auto unentitled = daemon->connectAs("com.example.plain", {});
    ASSERT_NE(unentitled, nullptr);
    EXPECT_EQ(connectedCommands(*unentitled), (std::set<uint64_t>{0, 13, 15, 16, 17, 28}));

    auto lookup = daemon->connectAs(
        "com.example.lookup",
        {{"com.vorlane.private.Stowly.lookup",
          STWValue(STWValue::Dictionary{{"appData", STWValue(STWValue::Array{STWValue("com.example.other")})}})}});
    ASSERT_NE(lookup, nullptr);
    EXPECT_EQ(connectedCommands(*lookup), (std::set<uint64_t>{0, 1, 13, 14, 15, 16, 17, 23, 28}));

    auto full = daemon->connectAs("com.example.allowed", allowed);
    ASSERT_NE(full, nullptr);
    std::set<uint64_t> expected;
    for (uint64_t c = 0; c < 32; c++)
        if (c != 25 && c != 31)
            expected.insert(c);
    EXPECT_EQ(connectedCommands(*full), expected);
}

TEST_F(STWRequestServiceTest, ConcurrentConnectionsEachGetTheirOwnReplies) {
    constexpr int kConnections = 64;
    std::atomic<int> wrong{0}, missing{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < kConnections; i++) {
        threads.emplace_back([&, i] {
            // Even connections may replace containers (and are told that they named none), odd
            // ones may not.
            bool entitled = i % 2 == 0;
            auto client = daemon->connectAs("com.example.c" + std::to_string(i),
                                            entitled ? allowed : STWValue::Dictionary{});
            if (!client) {
                missing++;
                return;
            }
            for (int round = 0; round < 20; round++) {
                uint64_t code = STWDaemonProcess::replyError(*client, 2, {{"Round", STWValue(round)}});
                if (code == 0)
                    missing++;
                else if (code != (entitled ? STWErrorNoIdentifier : STWErrorNotEntitled))
                    wrong++;
            }
        });
    }
    for (auto& t : threads)
        t.join();
    EXPECT_EQ(missing, 0);
    EXPECT_EQ(wrong, 0);
}

TEST_F(STWRequestServiceTest, MalformedInputClosesOnlyThatConnection) {
    auto bystander = daemon->connectAs("com.example.bystander", allowed);
    ASSERT_NE(bystander, nullptr);

    std::string request = STWFrameEncode(STWFrameKindRequest, 1, {{"Command", STWValue(27)}});
    std::vector<std::pair<const char*, std::string>> inputs = {
        {"oversized length", std::string("\xff\xff\xff\x7f", 4)},
        {"broken MessagePack", lengthPrefixed("\x93\x00\x01\xc1")},
        {"body not a map", lengthPrefixed(STWMessagePackEncode(
                               STWValue(STWValue::Array{STWValue(0), STWValue(1), STWValue("body")})))},
        {"more values than a request may have",
         STWFrameEncode(STWFrameKindRequest, 1,
                        {{"K", STWValue(STWValue::Array(STWIPCRequestMaxObjects, STWValue()))}})},
        {"unknown frame kind", STWFrameEncode(7, 1, {})},
        {"reply frame from a client", STWFrameEncode(STWFrameKindReply, 1, {})},
        {"hello after a request",
         request + STWFrameEncode(STWFrameKindHello, 2, {{"CodeSigningIdentifier", STWValue("x")}})},
    };
    for (const auto& [what, bytes] : inputs) {
        int fd = daemon->connectRaw();
        ASSERT_GE(fd, 0);
        ASSERT_EQ(send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size())) << what;
        EXPECT_TRUE(STWDaemonProcess::closedByDaemon(fd)) << what;
        close(fd);
    }
    // A client that goes away in the middle of a frame, and one in the middle of waiting.
    for (size_t cut : {size_t{2}, request.size() - 1, request.size()}) {
        int fd = daemon->connectRaw();
        ASSERT_GE(fd, 0);
        send(fd, request.data(), cut, MSG_NOSIGNAL);
        close(fd);
    }
    EXPECT_TRUE(daemon->isRunning());
    EXPECT_EQ(STWDaemonProcess::replyError(*bystander, 2), STWErrorNoIdentifier);
}

TEST_F(STWRequestServiceTest, RegistryIdentifiesProgramsByTheirPinnedExecutable) {
    // Without a hello, this test program is whoever the registry says it is.
    auto anonymous = daemon->connect();
    ASSERT_NE(anonymous, nullptr);
    EXPECT_EQ(STWDaemonProcess::replyError(*anonymous, 2), STWErrorNotEntitled);

    char self[4096];
    ssize_t n = readlink("/proc/self/exe", self, sizeof self - 1);
    ASSERT_GT(n, 0);
    self[n] = '\0';
    STWValue::Dictionary entry{{"CodeSigningIdentifier", STWValue("com.example.e2e")},
                               {"Executable", STWValue(self)},
                               {"Entitlements", STWValue(allowed)}};
    auto file = daemon->root() / "etc/stowly/clients.d/e2e.plist";
    // The registry follows its directory: poll until the daemon sees each change. Who a
    // caller is is settled when it connects, so every probe is a new connection.
    auto waitFor = [&](uint64_t expected) {
        uint64_t code = 0;
        for (int i = 0; i < 250 && code != expected; i++) {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
            code = STWDaemonProcess::replyError(*daemon->connect(), 2);
        }
        return code;
    };
    ASSERT_TRUE(STW_writeToURL(entry, file, STWWriteAtomic, nullptr));
    EXPECT_EQ(waitFor(STWErrorNoIdentifier), STWErrorNoIdentifier);
    // A connection made before is still who it was when it connected.
    EXPECT_EQ(STWDaemonProcess::replyError(*anonymous, 2), STWErrorNotEntitled);
    // The same entry pinned to another digest identifies nobody.
    entry["SHA256"] = STWValue(std::string(64, '0'));
    ASSERT_TRUE(STW_writeToURL(entry, file, STWWriteAtomic, nullptr));
    EXPECT_EQ(waitFor(STWErrorNotEntitled), STWErrorNotEntitled);
    std::filesystem::remove(file);
}

TEST(STWRequestServiceWithoutDeveloperMode, HelloIsRefusedAndTheConnectionClosed) {
    STWDaemonProcess daemon({});
    auto client = daemon.connect();
    ASSERT_NE(client, nullptr);
    STWErrorRef error;
    auto code = client->hello({{"CodeSigningIdentifier", STWValue("com.example.liar")}}, STWDaemonProcess::timeout,
                              &error);
    EXPECT_EQ(code.value_or(0), STWErrorNotEntitled);
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 2), 0u); // closed: no reply
}
