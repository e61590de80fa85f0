#include "common/STWIPCFrame.h"
#include "common/STWMessagePack.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <pthread.h>
#include <sys/socket.h>
#include <thread>
#include <unistd.h>

namespace {

// A connected stream pair: the reader's end and the writer's.
struct SocketPair {
    SocketPair() { EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0); }
    ~SocketPair() {
        closeEnd(0);
        closeEnd(1);
    }
    void closeEnd(int end) {
        if (fds[end] >= 0)
            close(fds[end]);
        fds[end] = -1;
    }
    void write(std::string_view bytes) { ASSERT_TRUE(STWFrameWrite(fds[1], bytes)) << strerror(errno); }

    int fds[2] = {-1, -1};
};

} // namespace

TEST(STWIPCFrame, EncodesAGenericArrayAndDecodesOnlyThatShape) {
    using A = STWValue::Array;
    STWValue::Dictionary body{{"Command", STWValue(7)}, {"Identifier", STWValue("com.example.app")}};
    // A little-endian length, then what a generic encoder would write for [kind, id, body].
    std::string payload =
        STWMessagePackEncode(STWValue(A{STWValue(1), STWValue(UINT64_MAX), STWValue(body)}));
    uint32_t length = static_cast<uint32_t>(payload.size());
    EXPECT_EQ(STWFrameEncode(STWFrameKindReply, UINT64_MAX, body),
              std::string(reinterpret_cast<const char*>(&length), 4) + payload); // little-endian host
    // A kind this side does not know is handed on for the receiver to judge.
    std::string reason;
    auto unknown = STWFrameDecode(
        STWMessagePackEncode(STWValue(A{STWValue(9), STWValue(UINT64_MAX), STWValue(body)})), &reason);
    ASSERT_TRUE(unknown) << reason;
    EXPECT_EQ(unknown->kind, 9u);
    EXPECT_EQ(unknown->id, UINT64_MAX);
    EXPECT_EQ(unknown->body, body);

    // A body of another type and broken MessagePack close the connection in the end-to-end tests.
    STWValue map(STWValue::Dictionary{});
    const std::pair<const char*, std::string> cases[] = {
        {"not an array", STWMessagePackEncode(map)},
        {"two elements", STWMessagePackEncode(STWValue(A{STWValue(0), STWValue(1)}))},
        {"four elements", STWMessagePackEncode(STWValue(A{STWValue(0), STWValue(1), map, map}))},
        {"negative kind", STWMessagePackEncode(STWValue(A{STWValue(-1), STWValue(1), map}))},
        {"string id", STWMessagePackEncode(STWValue(A{STWValue(0), STWValue("1"), map}))},
        {"real id", STWMessagePackEncode(STWValue(A{STWValue(0), STWValue(1.0), map}))},
        {"body nil", STWMessagePackEncode(STWValue(A{STWValue(0), STWValue(1), STWValue()}))},
        {"empty payload", ""},
    };
    for (const auto& [what, bytes] : cases) {
        reason.clear();
        EXPECT_FALSE(STWFrameDecode(bytes, &reason)) << what;
        EXPECT_FALSE(reason.empty()) << what;
    }
}

TEST(STWFrameReader, ReadsFramesPackedTogetherAndSplitApart) {
    SocketPair pair;
    std::string stream;
    for (uint64_t id = 1; id <= 50; ++id)
        stream += STWFrameEncode(STWFrameKindRequest, id, {{"N", STWValue(id)}});
    // A frame of exactly the limit; the empty entry's bin8 header grows into a bin32 one.
    size_t overhead = STWFrameEncode(STWFrameKindRequest, 51, {{"D", STWValue(STWData{})}}).size() - 4 + 3;
    STWValue::Dictionary large{{"D", STWValue(STWData(STWFrameMaxSize - overhead, 0xab))}};
    std::string limit = STWFrameEncode(STWFrameKindRequest, 51, large);
    ASSERT_EQ(limit.size() - 4, STWFrameMaxSize);
    stream += limit;
    // The writer trickles the stream in uneven pieces, some cutting through the length.
    std::thread writer([&] {
        for (size_t at = 0, step = 1; at < stream.size(); at += step, step = step * 3 % 1021 + 1) {
            if (!STWFrameWrite(pair.fds[1], std::string_view(stream).substr(at, step)))
                return;
        }
        pair.closeEnd(1);
    });
    STWFrameReader reader(pair.fds[0]);
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

TEST(STWFrameReader, ReadOfAsManyBytesAsWereConsumedIsNotTheEnd) {
    // The first frame and the head of the second arrive together; the rest of the second
    // is exactly as long as the first. Once the reader has moved the head to the front of
    // its buffer, that last read leaves the buffer as full as before it.
    SocketPair pair;
    std::string first = STWFrameEncode(STWFrameKindRequest, 1, {{"N", STWValue(1)}});
    std::string second = STWFrameEncode(STWFrameKindRequest, 2, {{"Blob", STWValue(STWData(100, 7))}});
    ASSERT_GT(second.size(), first.size());
    size_t head = second.size() - first.size();
    pair.write(first + second.substr(0, head));
    STWFrameReader reader(pair.fds[0]);
    STWFrame frame;
    std::string reason;
    ASSERT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    pair.write(second.substr(head));
    ASSERT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    EXPECT_EQ(frame.id, 2u);
}

// After a good frame, each broken stream is an Error with its errno; the first two with the
// writer still open, where a reader that waited for (or allocated) its payload would block.
TEST(STWFrameReader, BrokenStreamsFailWithTheirErrno) {
    std::string good = STWFrameEncode(STWFrameKindRequest, 1, {{"K", STWValue("value")}});
    uint32_t over = STWFrameMaxSize + 1;
    std::string broken("\x08\x00\x00\x00\x93\x00\x01\xdd\xff\xff\xff\xff", 12); // array32 of 4 billion
    const struct {
        const char* what;
        std::string bytes;
        bool closed;
        int error;
        const char* reason;
    } cases[] = {
        {"oversized length", std::string(reinterpret_cast<const char*>(&over), 4), false, EMSGSIZE,
         "over the limit"},
        {"broken payload", broken, false, EBADMSG, "beyond the end"},
        {"end inside the length", good.substr(0, 2), true, ECONNRESET, "inside a frame"},
        {"end inside the payload", good.substr(0, good.size() - 1), true, ECONNRESET, "inside a frame"},
    };
    for (const auto& c : cases) {
        SocketPair pair;
        pair.write(good + c.bytes);
        if (c.closed)
            pair.closeEnd(1);
        STWFrameReader reader(pair.fds[0]);
        STWFrame frame;
        std::string reason;
        EXPECT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << c.what << ": " << reason;
        STWFrameReadResult result = reader.read(frame, &reason);
        int error = errno;
        EXPECT_EQ(result, STWFrameReadResult::Error) << c.what;
        EXPECT_EQ(error, c.error) << c.what;
        EXPECT_NE(reason.find(c.reason), std::string::npos) << c.what << ": " << reason;
    }
}

TEST(STWFrameWrite, SurvivesSignalsAndAFullSocket) {
    // A small send buffer and a slow reader force partial sends; signals without
    // SA_RESTART interrupt the blocked ones.
    SocketPair pair;
    struct sigaction action {};
    action.sa_handler = [](int) {};
    struct sigaction old {};
    ASSERT_EQ(sigaction(SIGUSR1, &action, &old), 0);
    int small = 4096;
    setsockopt(pair.fds[1], SOL_SOCKET, SO_SNDBUF, &small, sizeof small);

    std::string frame = STWFrameEncode(STWFrameKindReply, 1, {{"Blob", STWValue(STWData(2000000, 0x5a))}});
    std::atomic<bool> written{false};
    bool ok = false;
    std::thread writer([&] {
        ok = STWFrameWrite(pair.fds[1], frame);
        written = true;
    });
    std::string received;
    char buffer[8192];
    while (received.size() < frame.size()) {
        if (!written)
            pthread_kill(writer.native_handle(), SIGUSR1);
        ssize_t n = recv(pair.fds[0], buffer, sizeof buffer, 0);
        ASSERT_GT(n, 0);
        received.append(buffer, static_cast<size_t>(n));
    }
    writer.join();
    sigaction(SIGUSR1, &old, nullptr);
    EXPECT_TRUE(ok);
    EXPECT_EQ(received, frame);

    // Without MSG_NOSIGNAL the default SIGPIPE action would end the test process here.
    pair.closeEnd(0);
    errno = 0;
    ok = STWFrameWrite(pair.fds[1], frame);
    int error = errno;
    EXPECT_FALSE(ok);
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
    SocketPair pairs[3];
    STWFrame frame;
    std::string reason;
    {
        pairs[0].write(std::string_view(large).substr(0, 100000));
        pairs[1].write(std::string_view(large).substr(0, 100000));
        STWFrameReader stalled(pairs[0].fds[0], limits), refused(pairs[1].fds[0], limits);
        EXPECT_EQ(stalled.read(frame, &reason), STWFrameReadResult::Error);
        EXPECT_EQ(errno, ETIMEDOUT) << reason;
        EXPECT_GT(budget.reserved(), 100000u);
        EXPECT_EQ(refused.read(frame, &reason), STWFrameReadResult::Error);
        EXPECT_EQ(errno, ENOBUFS) << reason;
    }
    EXPECT_EQ(budget.reserved(), 0u);
    std::thread writer([&] { STWFrameWrite(pairs[2].fds[1], large); });
    STWFrameReader reader(pairs[2].fds[0], limits);
    EXPECT_EQ(reader.read(frame, &reason), STWFrameReadResult::Frame) << reason;
    EXPECT_EQ(budget.reserved(), 0u);
    writer.join();
}
