// The request socket: who gets a connection for which command, many connections at once,
// malformed input, the client registry, and what a daemon without developer mode refuses.
#include "tests/e2e/STWE2ETestSupport.h"

#include "common/STWMessagePack.h"
#include "common/STWIPCFrame.h"
#include "platform/STWIPCListener.h"

#include <gtest/gtest.h>

#include <atomic>
#include <mutex>
#include <set>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

using namespace STWE2E;

namespace {

// Commands whose reply is not "not entitled" (they may still be unsupported in this build).
std::set<uint64_t> connectedCommands(STWClient& client) {
    std::set<uint64_t> commands;
    for (uint64_t c = 0; c < 32; c++) {
        // One's own system container needs an entitlement; a well-known one is anyone's.
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


std::string lengthPrefixed(const std::string& payload) { return frameHeader(payload.size()) + payload; }

using STWRequestServiceTest = SharedDaemonTest;

} // namespace

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
    // Command numbers outside the table, and 27, are unsupported.
    for (uint64_t command : {uint64_t{27}, uint64_t{32}, uint64_t{1} << 63, UINT64_MAX})
        EXPECT_EQ(STWDaemonProcess::replyError(*full, command), STWErrorUnsupportedCommand) << command;
}

// 64 connections at once, every other one unentitled, each asking ten times for one new container:
// every reply reaches its own caller (the unentitled are refused), and one whole container is made.
TEST_F(STWRequestServiceTest, ConcurrentConnectionsGetTheirOwnRepliesAndMakeOneContainer) {
    constexpr int kConnections = 64, kRounds = 10;
    fs::path classDirectory = path(send(0, keys("com.example.probe"))).parent_path();
    ASSERT_FALSE(classDirectory.empty());
    size_t before = visible(classDirectory);
    std::atomic<int> wrong{0}, missing{0}, created{0}, existed{0};
    std::mutex mutex;
    std::set<fs::path> paths;
    std::vector<std::thread> threads;
    for (int i = 0; i < kConnections; i++) {
        threads.emplace_back([&, i] {
            bool entitled = i % 2 == 0;
            auto caller = daemon->connectAs("com.example.c" + std::to_string(i), entitled ? allowed : STWValue::Dictionary{});
            missing += !caller;
            for (int round = 0; caller && round < kRounds; round++) {
                auto reply = STWDaemonProcess::send(*caller, 0, keys("com.example.racer"));
                if (reply.empty()) {
                    missing++;
                } else if (code(reply) != (entitled ? STWErrorSuccess : STWErrorNotEntitled)) {
                    wrong++;
                } else if (entitled) {
                    (reply["ReplyExisted"] == STWValue(true) ? existed : created)++;
                    std::lock_guard lock(mutex);
                    paths.insert(path(reply));
                }
            }
        });
    }
    for (auto& t : threads)
        t.join();
    EXPECT_EQ(missing, 0);
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(created, 1);
    EXPECT_EQ(existed, kConnections / 2 * kRounds - 1);
    ASSERT_EQ(paths.size(), 1u);
    fs::path container = *paths.begin();
    EXPECT_TRUE(fs::is_directory(container / "Library/Preferences"));
    EXPECT_TRUE(fs::exists(container / ".com.vorlane.stowly.metadata.plist"));
    EXPECT_EQ(container.parent_path(), classDirectory);
    EXPECT_EQ(visible(classDirectory), before + 1);
    auto listed = send(1, {{"ContainerClass", STWValue(2)}});
    ASSERT_EQ(code(listed), STWErrorSuccess);
    int racers = 0;
    for (const auto& id : *STWDictionaryFind(listed, "ReplyIdsArray")->array())
        racers += *id.string() == "com.example.racer";
    EXPECT_EQ(racers, 1);
}

TEST_F(STWRequestServiceTest, MalformedInputClosesOnlyThatConnection) {
    auto bystander = daemon->connectAs("com.example.bystander", allowed);
    ASSERT_NE(bystander, nullptr);

    std::string request = STWFrameEncode(STWFrameKindRequest, 1, {{"Command", STWValue(27)}});
    std::vector<std::pair<const char*, std::string>> inputs = {
        {"oversized length", std::string("\xff\xff\xff\x7f", 4)},
        {"broken MessagePack", lengthPrefixed(std::string("\x93\x00\x01\xc1", 4))},
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
        ASSERT_EQ(::send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size())) << what;
        EXPECT_TRUE(STWDaemonProcess::closedByDaemon(fd)) << what;
        close(fd);
    }
    // A client that goes away in the middle of a frame, and one in the middle of waiting.
    for (size_t cut : {size_t{2}, request.size() - 1, request.size()}) {
        int fd = daemon->connectRaw();
        ASSERT_GE(fd, 0);
        ::send(fd, request.data(), cut, MSG_NOSIGNAL);
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
    // Polled until the daemon sees each change, on new connections: a caller is settled when it connects.
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

// Without developer mode a hello that declares an identity is refused and the connection
// closed; a client that goes silent, before its first frame or inside one, is dropped.
TEST(STWRequestServiceWithoutDeveloperMode, DeclaredIdentitiesAndSilentClientsAreRefused) {
    STWDaemonProcess daemon({{"FirstFrameTimeout", STWValue(1)}, {"FrameTimeout", STWValue(1)}});
    auto client = daemon.connect();
    ASSERT_NE(client, nullptr);
    STWErrorRef error;
    auto hello = client->hello({{"CodeSigningIdentifier", STWValue("com.example.liar")}}, STWDaemonProcess::timeout,
                               &error);
    EXPECT_EQ(hello.value_or(0), STWErrorNotEntitled);
    EXPECT_EQ(STWDaemonProcess::replyError(*client, 2), 0u); // closed: no reply

    int silent = daemon.connectRaw(), stalled = daemon.connectRaw();
    ASSERT_GE(silent, 0);
    ASSERT_GE(stalled, 0);
    std::string request = frameHeader(100) + std::string("\x93\x00\x01", 3);
    ASSERT_EQ(::send(stalled, request.data(), request.size(), MSG_NOSIGNAL), ssize_t(request.size()));
    EXPECT_TRUE(STWDaemonProcess::closedByDaemon(silent));
    EXPECT_TRUE(STWDaemonProcess::closedByDaemon(stalled));
    close(silent);
    close(stalled);
}
