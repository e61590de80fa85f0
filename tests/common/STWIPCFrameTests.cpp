#include "common/STWMessagePack.h"
#include "common/STWIPCFrame.h"

#include <gtest/gtest.h>

#include <array>
#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <pthread.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace {

std::string payloadOf(const STWValue& value) {
    return STWMessagePackEncode(value);
}

std::string withLength(const std::string& payload) {
    std::string frame(4, '\0');
    for (int i = 0; i < 4; ++i)
        frame[i] = static_cast<char>(payload.size() >> (8 * i));
    return frame + payload;
}

class STWFrameSocketTest : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0); }
    void TearDown() override {
        closeWriter();
        close(fds[0]);
    }
    void closeWriter() {
        if (fds[1] >= 0)
            close(fds[1]);
        fds[1] = -1;
    }
    void writeRaw(const std::string& s) { ASSERT_TRUE(STWFrameWrite(fds[1], s)) << strerror(errno); }

    int fds[2] = {-1, -1};
};

} // namespace

TEST(STWIPCFrame, EncodeAndDecode) {
    STWValue::Dictionary body{{"Command", STWValue(7)}, {"Identifier", STWValue("com.example.app")}};
    std::string frame = STWFrameEncode(STWFrameKindReply, UINT64_MAX, body);
    uint32_t length = 0;
    memcpy(&length, frame.data(), 4); // little-endian host
    ASSERT_EQ(length, frame.size() - 4);
    std::string reason;
    auto decoded = STWFrameDecode(std::string_view(frame).substr(4), &reason);
    ASSERT_TRUE(decoded) << reason;
    EXPECT_EQ(decoded->kind, STWFrameKindReply);
    EXPECT_EQ(decoded->id, UINT64_MAX);
    EXPECT_EQ(decoded->body, body);
    // The frame array is what a generic encoder would write for the same value.
    EXPECT_EQ(frame.substr(4),
              payloadOf(STWValue(STWValue::Array{STWValue(1), STWValue(UINT64_MAX), STWValue(body)})));
    // A kind this side does not know is handed on for the receiver to judge.
    auto unknown = STWFrameDecode(
        payloadOf(STWValue(STWValue::Array{STWValue(9), STWValue(1), STWValue(STWValue::Dictionary{})})),
        nullptr);
    ASSERT_TRUE(unknown);
    EXPECT_EQ(unknown->kind, 9u);
}

TEST(STWIPCFrame, DecodeRefusesFramesOfTheWrongShape) {
    using A = STWValue::Array;
    STWValue map(STWValue::Dictionary{});
    const std::pair<const char*, std::string> cases[] = {
        {"not an array", payloadOf(map)},
        {"two elements", payloadOf(STWValue(A{STWValue(0), STWValue(1)}))},
        {"four elements", payloadOf(STWValue(A{STWValue(0), STWValue(1), map, map}))},
        {"negative kind", payloadOf(STWValue(A{STWValue(-1), STWValue(1), map}))},
        {"string id", payloadOf(STWValue(A{STWValue(0), STWValue("1"), map}))},
        {"real id", payloadOf(STWValue(A{STWValue(0), STWValue(1.0), map}))},
        {"body an array", payloadOf(STWValue(A{STWValue(0), STWValue(1), STWValue(A{})}))},
        {"body nil", payloadOf(STWValue(A{STWValue(0), STWValue(1), STWValue()}))},
        {"broken MessagePack", std::string("\x93\x00\x01\x81\x01\xc0", 6)},
        {"empty payload", ""},
    };
    for (const auto& [what, payload] : cases) {
        std::string reason;
        EXPECT_FALSE(STWFrameDecode(payload, &reason)) << what;
        EXPECT_FALSE(reason.empty()) << what;
    }
}

TEST_F(STWFrameSocketTest, ReadsFramesPackedTogetherAndSplitApart) {
    std::string stream;
    for (uint64_t id = 1; id <= 50; ++id)
        stream += STWFrameEncode(STWFrameKindRequest, id, {{"N", STWValue(id)}});
    // A frame much larger than one read.
    STWValue::Dictionary large{{"Blob", STWValue(STWData(300000, 0xab))}};
    stream += STWFrameEncode(STWFrameKindRequest, 51, large);
    // The writer trickles the stream in uneven pieces, some cutting through the length.
    std::thread writer([&] {
        for (size_t at = 0, step = 1; at < stream.size(); at += step, step = step * 3 % 1021 + 1) {
            if (!STWFrameWrite(fds[1], std::string_view(stream).substr(at, step)))
                return;
        }
        closeWriter();
    });
    STWFrameReader reader(fds[0]);
    for (uint64_t id = 1; id <= 51; ++id) {
        STWFrame frame;
        std::string reason;
        ASSERT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
        EXPECT_EQ(frame.id, id);
        EXPECT_EQ(frame.body, (id <= 50 ? STWValue::Dictionary{{"N", STWValue(id)}} : large));
    }
    STWFrame frame;
    EXPECT_EQ(reader.read(frame, nullptr), STWFrameReadResult::EndOfStream);
    writer.join();
}

TEST_F(STWFrameSocketTest, ReadOfAsManyBytesAsWereConsumedIsNotTheEnd) {
    // The first frame and the head of the second arrive together; the rest of the second
    // is exactly as long as the first. Once the reader has moved the head to the front of
    // its buffer, that last read leaves the buffer as full as before it.
    std::string first = STWFrameEncode(STWFrameKindRequest, 1, {{"N", STWValue(1)}});
    std::string second = STWFrameEncode(STWFrameKindRequest, 2, {{"Blob", STWValue(STWData(100, 7))}});
    ASSERT_GT(second.size(), first.size());
    size_t head = second.size() - first.size();
    writeRaw(first + second.substr(0, head));
    STWFrameReader reader(fds[0]);
    STWFrame frame;
    std::string reason;
    ASSERT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    writeRaw(second.substr(head));
    ASSERT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    EXPECT_EQ(frame.id, 2u);
}

TEST_F(STWFrameSocketTest, EndOfStreamInsideAFrameIsAnError) {
    std::string frame = STWFrameEncode(STWFrameKindRequest, 1, {{"K", STWValue("value")}});
    for (size_t cut : {size_t(2), frame.size() - 1}) {
        int pair[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, pair), 0);
        ASSERT_TRUE(STWFrameWrite(pair[1], frame));
        ASSERT_TRUE(STWFrameWrite(pair[1], std::string_view(frame).substr(0, cut)));
        close(pair[1]);
        STWFrameReader reader(pair[0]);
        STWFrame read;
        std::string reason;
        EXPECT_EQ(reader.read(read, &reason), STWFrameReadResult::Frame) << reason;
        EXPECT_EQ(reader.read(read, &reason), STWFrameReadResult::Error) << "cut at " << cut;
        EXPECT_NE(reason.find("inside a frame"), std::string::npos) << reason;
        close(pair[0]);
    }
}

TEST_F(STWFrameSocketTest, OversizedLengthIsRefusedWithoutWaitingForThePayload) {
    // Only the length arrives and the writer stays open: a reader that tried to read or
    // allocate the payload first would block here.
    uint32_t length = STWFrameMaxSize + 1;
    writeRaw(std::string(reinterpret_cast<const char*>(&length), 4));
    STWFrameReader reader(fds[0]);
    STWFrame frame;
    std::string reason;
    STWFrameReadResult result = reader.read(frame, &reason);
    int error = errno;
    EXPECT_EQ(result, STWFrameReadResult::Error);
    EXPECT_EQ(error, EMSGSIZE);
    EXPECT_NE(reason.find("over the limit"), std::string::npos) << reason;
}

TEST_F(STWFrameSocketTest, FrameOfExactlyTheLimitIsRead) {
    // Fill the payload to the limit: array header, kind, id, map of one data entry.
    std::string empty = STWFrameEncode(STWFrameKindRequest, 3, {{"D", STWValue(STWData{})}});
    size_t overhead = empty.size() - 4 + 3; // the bin8 header grows into a bin32 one
    STWValue::Dictionary body{{"D", STWValue(STWData(STWFrameMaxSize - overhead, 1))}};
    std::string frame = STWFrameEncode(STWFrameKindRequest, 3, body);
    ASSERT_EQ(frame.size() - 4, STWFrameMaxSize);
    std::thread writer([&] { STWFrameWrite(fds[1], frame); });
    STWFrameReader reader(fds[0]);
    STWFrame read;
    std::string reason;
    EXPECT_EQ(reader.read(read, &reason), STWFrameReadResult::Frame) << reason;
    EXPECT_EQ(read.body, body);
    writer.join();
}

TEST_F(STWFrameSocketTest, BrokenPayloadIsAnError) {
    writeRaw(withLength(std::string("\x93\x00\x01\xdd\xff\xff\xff\xff", 8)));
    STWFrameReader reader(fds[0]);
    STWFrame frame;
    STWFrameReadResult result = reader.read(frame, nullptr);
    int error = errno;
    EXPECT_EQ(result, STWFrameReadResult::Error);
    EXPECT_EQ(error, EBADMSG);
}

TEST_F(STWFrameSocketTest, WriteSurvivesSignalsAndAFullSocket) {
    // A small send buffer and a slow reader force partial sends; signals without
    // SA_RESTART interrupt the blocked ones.
    struct sigaction action {};
    action.sa_handler = [](int) {};
    struct sigaction old {};
    ASSERT_EQ(sigaction(SIGUSR1, &action, &old), 0);
    int small = 4096;
    setsockopt(fds[1], SOL_SOCKET, SO_SNDBUF, &small, sizeof small);

    std::string frame = STWFrameEncode(STWFrameKindReply, 1, {{"Blob", STWValue(STWData(2000000, 0x5a))}});
    std::atomic<bool> written{false};
    bool ok = false;
    std::thread writer([&] {
        ok = STWFrameWrite(fds[1], frame);
        written = true;
    });
    pthread_t writerThread = writer.native_handle();
    std::string received;
    char buffer[8192];
    while (received.size() < frame.size()) {
        if (!written)
            pthread_kill(writerThread, SIGUSR1);
        ssize_t n = recv(fds[0], buffer, sizeof buffer, 0);
        ASSERT_GT(n, 0);
        received.append(buffer, static_cast<size_t>(n));
    }
    writer.join();
    sigaction(SIGUSR1, &old, nullptr);
    EXPECT_TRUE(ok);
    EXPECT_EQ(received, frame);
}

TEST_F(STWFrameSocketTest, WriteToAClosedPeerFailsWithoutSIGPIPE) {
    close(fds[0]);
    fds[0] = socket(AF_UNIX, SOCK_STREAM, 0); // keep TearDown's close harmless
    // Without MSG_NOSIGNAL the default SIGPIPE action would end the test process here.
    errno = 0;
    bool written = STWFrameWrite(fds[1], STWFrameEncode(STWFrameKindReply, 1, {}));
    int error = errno;
    EXPECT_FALSE(written);
    EXPECT_EQ(error, EPIPE);
}

// Readers of a budget hold the bytes of their large frames only while they arrive: one
// that stalls inside a frame holds them until it ends, and a second one finds no room.
TEST(STWFrameReaderBudget, LargeFramesReserveTheirBytesUntilTheyAreDone) {
    STWIPCFrameBudget budget(200000);
    STWFrameReaderLimits limits;
    limits.frameTimeout = std::chrono::milliseconds(100);
    limits.budget = &budget;
    std::string large = STWFrameEncode(STWFrameKindRequest, 1, {{"Blob", STWValue(STWData(200000, 1))}});
    std::vector<std::array<int, 2>> pairs(3);
    for (auto& pair : pairs)
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair.data()), 0);
    STWFrame frame;
    std::string reason;
    {
        ASSERT_TRUE(STWFrameWrite(pairs[0][1], std::string_view(large).substr(0, 100000)));
        ASSERT_TRUE(STWFrameWrite(pairs[1][1], std::string_view(large).substr(0, 100000)));
        STWFrameReader stalled(pairs[0][0], limits), refused(pairs[1][0], limits);
        EXPECT_EQ(stalled.read(frame, &reason), STWFrameReadResult::Error);
        EXPECT_EQ(errno, ETIMEDOUT) << reason;
        EXPECT_GT(budget.reserved(), 100000u);
        EXPECT_EQ(refused.read(frame, &reason), STWFrameReadResult::Error);
        EXPECT_EQ(errno, ENOBUFS) << reason;
    }
    EXPECT_EQ(budget.reserved(), 0u);
    std::thread writer([&] { STWFrameWrite(pairs[2][1], large); });
    STWFrameReader reader(pairs[2][0], limits);
    EXPECT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    EXPECT_EQ(budget.reserved(), 0u);
    writer.join();
    for (auto& pair : pairs) {
        close(pair[0]);
        close(pair[1]);
    }
}
