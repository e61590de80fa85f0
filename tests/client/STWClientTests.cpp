#include "client/STWClient.h"
#include "tests/client/STWFakeDaemon.h"

#include <gtest/gtest.h>

#include <future>
#include <sys/socket.h>
#include <thread>

using namespace std::chrono_literals;

namespace {

// Long enough never to expire in a test that expects an answer: a failure caused by the
// connection shows up as its own error, not as a time-out.
constexpr auto kLong = 30s;

using Dictionary = STWValue::Dictionary;

std::optional<STWFrame> readFrame(STWFrameReader& reader) {
    return STWFakeDaemon::readFrame(reader);
}

// Blocks until the client closes its end.
void waitForClose(STWFrameReader& reader) {
    STWFrame frame;
    while (reader.read(frame, nullptr) == STWFrameReadResult::Frame) {
    }
}

std::unique_ptr<STWClient> connectTo(const STWFakeDaemon& daemon) {
    STWErrorRef error;
    auto client = STWClient::connect(daemon.socketPath(), &error);
    EXPECT_TRUE(client) << (error ? error->description() : "");
    return client;
}

int64_t posixCode(const STWErrorRef& error) {
    EXPECT_TRUE(error);
    if (!error)
        return 0;
    EXPECT_EQ(error->domain(), STWPOSIXErrorDomain) << error->description();
    return error->code();
}

} // namespace

TEST(STWClient, SocketPaths) {
    EXPECT_EQ(STWClient::defaultSocketPath(), "/run/stowly/stowlyd.sock");
    EXPECT_EQ(STWClient::socketPathForRoot("/tmp/r"), "/tmp/r/run/stowly/stowlyd.sock");
}

TEST(STWClient, ConnectFailures) {
    STWFakeDaemon daemon;
    STWErrorRef error;
    EXPECT_FALSE(STWClient::connect(daemon.root() / "missing.sock", &error));
    EXPECT_EQ(posixCode(error), ENOENT);
    EXPECT_FALSE(STWClient::connect("/tmp/" + std::string(200, 'x'), &error));
    EXPECT_EQ(posixCode(error), ENAMETOOLONG);
    // The socket file is there but nobody listens any more.
    daemon.stopListening();
    EXPECT_FALSE(STWClient::connect(daemon.socketPath(), &error));
    EXPECT_EQ(posixCode(error), ECONNREFUSED);
}

TEST(STWClient, RepliesOutOfOrderReachTheirCallers) {
    STWFakeDaemon daemon;
    constexpr int kCallers = 4;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        std::vector<STWFrame> requests;
        for (int i = 0; i < kCallers; ++i) {
            auto frame = readFrame(reader);
            if (!frame)
                return;
            EXPECT_EQ(frame->kind, STWFrameKindRequest);
            requests.push_back(std::move(*frame));
        }
        // Answer the last first, and name the id of a request nobody made in between.
        STWFakeDaemon::reply(fd, 999999, {{"ReplyError", STWValue(1)}});
        for (auto it = requests.rbegin(); it != requests.rend(); ++it)
            STWFakeDaemon::reply(fd, it->id, {{"ReplyError", STWValue(1)}, {"Echo", it->body.at("N")}});
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    std::vector<std::thread> callers;
    for (int n = 0; n < kCallers; ++n) {
        callers.emplace_back([&, n] {
            STWErrorRef error;
            auto reply = client->sendMessage({{"Command", STWValue(1)}, {"N", STWValue(n)}}, kLong, &error);
            ASSERT_TRUE(reply) << error->description();
            EXPECT_EQ(reply->at("Echo"), STWValue(n));
        });
    }
    for (std::thread& t : callers)
        t.join();
}

TEST(STWClient, ConcurrentSendersNeverMixFrames) {
    STWFakeDaemon daemon;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        STWFrame frame;
        std::string reason;
        STWFrameReadResult result;
        while ((result = reader.read(frame, &reason)) == STWFrameReadResult::Frame) {
            Dictionary body = frame.body;
            body["Size"] = STWValue(frame.body.at("Blob").data()->size());
            body.erase("Blob");
            STWFakeDaemon::reply(fd, frame.id, body);
        }
        EXPECT_EQ(result, STWFrameReadResult::EndOfStream) << reason;
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    constexpr int kThreads = 8, kMessages = 60;
    std::vector<std::thread> senders;
    for (int t = 0; t < kThreads; ++t) {
        senders.emplace_back([&, t] {
            for (int m = 0; m < kMessages; ++m) {
                // Some messages are larger than a socket buffer, so their sends go out in
                // pieces while other threads want to send too.
                size_t size = (t * kMessages + m) % 7 == 0 ? 300000 : size_t(m);
                Dictionary message{
                    {"T", STWValue(t)}, {"M", STWValue(m)}, {"Blob", STWValue(STWData(size, 1))}};
                STWErrorRef error;
                auto reply = client->sendMessage(message, kLong, &error);
                ASSERT_TRUE(reply) << error->description();
                EXPECT_EQ(*reply,
                          (Dictionary{{"T", STWValue(t)}, {"M", STWValue(m)}, {"Size", STWValue(size)}}));
            }
        });
    }
    for (std::thread& t : senders)
        t.join();
    client.reset();
}

TEST(STWClient, TimeOutAbandonsTheRequest) {
    STWFakeDaemon daemon;
    std::promise<void> timedOut;
    daemon.serve([&](int fd) {
        STWFrameReader reader(fd);
        auto first = readFrame(reader);
        if (!first)
            return;
        timedOut.get_future().wait();
        // The late reply must not be taken for the answer to the next request.
        STWFakeDaemon::reply(fd, first->id, {{"Answer", STWValue("late")}});
        auto second = readFrame(reader);
        if (!second)
            return;
        STWFakeDaemon::reply(fd, second->id, {{"Answer", STWValue("second")}});
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage({{"Command", STWValue(1)}}, 100ms, &error));
    EXPECT_EQ(posixCode(error), ETIMEDOUT);
    timedOut.set_value();
    auto reply = client->sendMessage({{"Command", STWValue(2)}}, kLong, &error);
    ASSERT_TRUE(reply) << error->description();
    EXPECT_EQ(reply->at("Answer"), STWValue("second"));
}

TEST(STWClient, DaemonClosingFailsEveryWaiterAtOnce) {
    STWFakeDaemon daemon;
    constexpr int kWaiters = 3;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        for (int i = 0; i < kWaiters; ++i)
            if (!readFrame(reader))
                return;
        // Closing without a word: every caller must learn now, not at its time-out.
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    std::vector<std::thread> waiters;
    for (int i = 0; i < kWaiters; ++i) {
        waiters.emplace_back([&] {
            STWErrorRef error;
            EXPECT_FALSE(client->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
            EXPECT_EQ(posixCode(error), ECONNRESET);
        });
    }
    for (std::thread& t : waiters)
        t.join();
    // And the connection stays failed.
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
    EXPECT_EQ(posixCode(error), ECONNRESET);
}

TEST(STWClient, GarbageFromTheDaemonFailsTheConnection) {
    STWFakeDaemon daemon;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        if (!readFrame(reader))
            return;
        STWFrameWrite(fd, std::string("\xff\xff\xff\xff", 4)); // a length far over the limit
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
    EXPECT_EQ(posixCode(error), EMSGSIZE);
}

TEST(STWClient, Hello) {
    STWFakeDaemon daemon;
    Dictionary identity{{"CodeSigningIdentifier", STWValue("com.example.tool")},
                        {"Entitlements", STWValue(Dictionary{{"com.example.entitled", STWValue(true)}})},
                        {"Sandboxed", STWValue(false)}};
    // Accepted: requests go on over the same connection.
    daemon.serve([&](int fd) {
        STWFrameReader reader(fd);
        auto hello = readFrame(reader);
        if (!hello)
            return;
        EXPECT_EQ(hello->kind, STWFrameKindHello);
        EXPECT_EQ(hello->body, identity);
        STWFakeDaemon::reply(fd, hello->id, {{"ReplyError", STWValue(1)}});
        auto request = readFrame(reader);
        if (!request)
            return;
        STWFakeDaemon::reply(fd, request->id, {{"ReplyError", STWValue(1)}});
        waitForClose(reader);
    });
    STWErrorRef error;
    {
        auto client = connectTo(daemon);
        ASSERT_TRUE(client);
        EXPECT_EQ(client->hello(identity, kLong, &error), 1u);
        EXPECT_TRUE(client->sendMessage({{"Command", STWValue(3)}}, kLong, &error));
    }
    daemon.join();

    // Refused: the daemon answers 55 and hangs up.
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        if (auto hello = readFrame(reader))
            STWFakeDaemon::reply(fd, hello->id, {{"ReplyError", STWValue(55)}});
        shutdown(fd, SHUT_WR);
        waitForClose(reader);
    });
    auto refused = connectTo(daemon);
    ASSERT_TRUE(refused);
    EXPECT_EQ(refused->hello(identity, kLong, &error), 55u);
    EXPECT_FALSE(refused->sendMessage({{"Command", STWValue(3)}}, kLong, &error));
    EXPECT_EQ(posixCode(error), ECONNRESET);
}

TEST(STWClient, HelloReplyWithoutReplyErrorIsAnError) {
    STWFakeDaemon daemon;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        if (auto hello = readFrame(reader))
            STWFakeDaemon::reply(fd, hello->id, {{"ReplyError", STWValue("1")}});
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    EXPECT_FALSE(client->hello({}, kLong, &error));
    EXPECT_EQ(posixCode(error), EBADMSG);
}

TEST(STWClient, OversizedMessageIsRefusedAndTheConnectionGoesOn) {
    STWFakeDaemon daemon;
    daemon.serve([](int fd) {
        STWFrameReader reader(fd);
        if (auto request = readFrame(reader))
            STWFakeDaemon::reply(fd, request->id, {{"ReplyError", STWValue(1)}});
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage({{"Blob", STWValue(STWData(STWFrameMaxSize, 0))}}, kLong, &error));
    EXPECT_EQ(posixCode(error), EMSGSIZE);
    EXPECT_TRUE(client->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
}

TEST(STWClient, SendBlockedOnADaemonThatDoesNotReadTimesOut) {
    STWFakeDaemon daemon;
    std::promise<void> done;
    daemon.serve([&](int) { done.get_future().wait(); });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    // Far more than the socket buffers hold: the send blocks part-way.
    EXPECT_FALSE(client->sendMessage({{"Blob", STWValue(STWData(8 << 20, 0))}}, 200ms, &error));
    EXPECT_EQ(posixCode(error), ETIMEDOUT);
    // Half a frame went out, so the stream is unusable from here on.
    EXPECT_FALSE(client->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
    EXPECT_EQ(posixCode(error), ETIMEDOUT);
    done.set_value();
}

TEST(STWClient, DestroyingTheClientReleasesItsWaiters) {
    STWFakeDaemon daemon;
    std::promise<void> received;
    daemon.serve([&](int fd) {
        STWFrameReader reader(fd);
        if (readFrame(reader))
            received.set_value();
        waitForClose(reader);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWClient* raw = client.get();
    std::thread waiter([raw] {
        STWErrorRef error;
        EXPECT_FALSE(raw->sendMessage({{"Command", STWValue(1)}}, kLong, &error));
        EXPECT_EQ(posixCode(error), ECANCELED);
    });
    received.get_future().wait();
    client.reset(); // returns only once the waiter has left sendMessage
    waiter.join();
}
