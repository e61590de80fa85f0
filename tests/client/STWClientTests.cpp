#include "client/STWClient.h"
#include "tests/client/STWFakeDaemon.h"

#include <gtest/gtest.h>

#include <future>
#include <thread>

using namespace std::chrono_literals;

namespace {

// Long enough never to expire in a test that expects an answer: a failure caused by the
// connection shows up as its own error, not as a time-out.
constexpr auto kLong = 30s;

using Dictionary = STWValue::Dictionary;
const Dictionary kCommand{{"Command", STWValue(1)}};

// Serves the next connection: `answer` gets every frame the client sends, and the client
// must end the stream cleanly, between frames.
void answerEach(STWFakeDaemon& daemon, std::function<void(int fd, const STWFrame&)> answer) {
    daemon.serve([answer = std::move(answer)](int fd) {
        STWFrameReader reader(fd);
        STWFrame frame;
        std::string reason;
        STWFrameReadResult result;
        while ((result = reader.read(frame, &reason)) == STWFrameReadResult::Frame)
            answer(fd, frame);
        EXPECT_EQ(result, STWFrameReadResult::EndOfStream) << reason;
    });
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

// Runs `body` on `count` threads at once and waits for them.
void onThreads(int count, const std::function<void(int)>& body) {
    std::vector<std::thread> threads;
    for (int i = 0; i < count; ++i)
        threads.emplace_back(body, i);
    for (std::thread& t : threads)
        t.join();
}

} // namespace

TEST(STWClient, RepliesOutOfOrderReachTheirCallers) {
    STWFakeDaemon daemon;
    constexpr int kCallers = 4;
    answerEach(daemon, [requests = std::vector<STWFrame>()](int fd, const STWFrame& frame) mutable {
        EXPECT_EQ(frame.kind, STWFrameKindRequest);
        requests.push_back(frame);
        if (requests.size() < size_t(kCallers))
            return;
        // Answer the last first, and name the id of a request nobody made in between.
        STWFakeDaemon::reply(fd, 999999, {{"ReplyError", STWValue(1)}});
        for (auto it = requests.rbegin(); it != requests.rend(); ++it)
            STWFakeDaemon::reply(fd, it->id, {{"ReplyError", STWValue(1)}, {"Echo", it->body.at("N")}});
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    onThreads(kCallers, [&](int n) {
        STWErrorRef error;
        auto reply = client->sendMessage({{"Command", STWValue(1)}, {"N", STWValue(n)}}, kLong, &error);
        ASSERT_TRUE(reply) << error->description();
        EXPECT_EQ(reply->at("Echo"), STWValue(n));
    });
}

TEST(STWClient, ConcurrentSendersNeverMixFrames) {
    STWFakeDaemon daemon;
    answerEach(daemon, [](int fd, const STWFrame& frame) {
        Dictionary body = frame.body;
        body["Size"] = STWValue(frame.body.at("Blob").data()->size());
        body.erase("Blob");
        STWFakeDaemon::reply(fd, frame.id, body);
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    constexpr int kMessages = 60;
    onThreads(8, [&](int t) {
        for (int m = 0; m < kMessages; ++m) {
            // Some messages are larger than a socket buffer, so their sends go out in
            // pieces while other threads want to send too.
            size_t size = (t * kMessages + m) % 7 == 0 ? 300000 : size_t(m);
            STWErrorRef error;
            auto reply = client->sendMessage(
                {{"T", STWValue(t)}, {"M", STWValue(m)}, {"Blob", STWValue(STWData(size, 1))}}, kLong,
                &error);
            ASSERT_TRUE(reply) << error->description();
            EXPECT_EQ(*reply, (Dictionary{{"T", STWValue(t)}, {"M", STWValue(m)}, {"Size", STWValue(size)}}));
        }
    });
}

TEST(STWClient, TimeOutAbandonsTheRequest) {
    STWFakeDaemon daemon;
    std::promise<void> timedOut;
    answerEach(daemon, [&](int fd, const STWFrame& frame) {
        if (frame.body.at("Command") == STWValue(1)) {
            // The late reply must not be taken for the answer to the next request.
            timedOut.get_future().wait();
            STWFakeDaemon::reply(fd, frame.id, {{"Answer", STWValue("late")}});
        } else {
            STWFakeDaemon::reply(fd, frame.id, {{"Answer", STWValue("second")}});
        }
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage(kCommand, 100ms, &error));
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
            if (!STWFakeDaemon::readFrame(reader))
                return;
        // Closing without a word: every caller must learn now, not at its time-out.
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    // The waiters, then a caller after them: the connection stays failed.
    onThreads(kWaiters, [&](int) {
        STWErrorRef error;
        EXPECT_FALSE(client->sendMessage(kCommand, kLong, &error));
        EXPECT_EQ(posixCode(error), ECONNRESET);
    });
    STWErrorRef error;
    EXPECT_FALSE(client->sendMessage(kCommand, kLong, &error));
    EXPECT_EQ(posixCode(error), ECONNRESET);
}

// Refused before anything is sent, the connection going on: a path too long for a socket, a
// message over the frame limit. A hello answered without a numeric ReplyError is no answer.
TEST(STWClient, RefusalsBeforeSendingAndAHelloWithoutANumericAnswer) {
    STWErrorRef error;
    EXPECT_FALSE(STWClient::connect("/tmp/" + std::string(200, 'x'), &error));
    EXPECT_EQ(posixCode(error), ENAMETOOLONG);
    STWFakeDaemon daemon;
    answerEach(daemon, [](int fd, const STWFrame& frame) {
        bool hello = frame.kind == STWFrameKindHello;
        STWFakeDaemon::reply(fd, frame.id, {{"ReplyError", hello ? STWValue("1") : STWValue(1)}});
    });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    EXPECT_FALSE(client->sendMessage({{"Blob", STWValue(STWData(STWFrameMaxSize, 0))}}, kLong, &error));
    EXPECT_EQ(posixCode(error), EMSGSIZE);
    EXPECT_TRUE(client->sendMessage(kCommand, kLong, &error));
    EXPECT_FALSE(client->hello({}, kLong, &error));
    EXPECT_EQ(posixCode(error), EBADMSG);
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
    EXPECT_FALSE(client->sendMessage(kCommand, kLong, &error));
    EXPECT_EQ(posixCode(error), ETIMEDOUT);
    done.set_value();
}

TEST(STWClient, DestroyingTheClientReleasesItsWaiters) {
    STWFakeDaemon daemon;
    std::promise<void> received;
    answerEach(daemon, [&](int, const STWFrame&) { received.set_value(); });
    auto client = connectTo(daemon);
    ASSERT_TRUE(client);
    std::thread waiter([raw = client.get()] {
        STWErrorRef error;
        EXPECT_FALSE(raw->sendMessage(kCommand, kLong, &error));
        EXPECT_EQ(posixCode(error), ECANCELED);
    });
    received.get_future().wait();
    client.reset(); // returns only once the waiter has left sendMessage
    waiter.join();
}
