// Frames of the request channel, shared by the daemon's listener and libstowly.
//
// On the stream socket every frame is a 4-byte little-endian payload length followed by
// that many bytes of MessagePack: the array [kind, id, body]. The client picks `id` and
// the daemon echoes it in the reply, since replies may come out of order. The payload is
// limited to STWFrameMaxSize; a longer declared length is refused before the payload is
// read.
#pragma once

#include "common/STWMessagePack.h"
#include "common/STWValue.h"
#include "common/STWIPCFrameBudget.h"

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

enum : uint64_t { STWFrameKindRequest = 0, STWFrameKindReply = 1, STWFrameKindHello = 2 };

inline constexpr size_t STWFrameMaxSize = 16 * 1024 * 1024; // payload limit, length prefix excluded
inline constexpr size_t STWFrameHeaderSize = 4;

struct STWFrame {
    uint64_t kind = 0;
    uint64_t id = 0;
    STWValue::Dictionary body;
};

// 4-byte little-endian payload length, then the MessagePack array [kind, id, body].
// Encoding does not enforce STWFrameMaxSize; senders check the size of what they send.
std::string STWFrameEncode(uint64_t kind, uint64_t id, const STWValue::Dictionary& body);

// Parses a payload (without its length prefix): an array of exactly 3, kind and id
// unsigned integers, body a map, at most `maxObjects` MessagePack objects in all.
// Unknown kinds are returned as they are (the receiver decides).
std::optional<STWFrame> STWFrameDecode(std::string_view payload, std::string* reason,
                                       size_t maxObjects = STWMessagePackMaxObjects);

enum class STWFrameReadResult { Frame, EndOfStream, Error };

// What a reader allows its peer. The defaults bound only the frame size and the decoded
// object count: the client library reads the daemon's replies, which may be large, and
// waits as long as its callers do. The daemon's listener sets all of them, since its
// peers may be hostile.
struct STWFrameReaderLimits {
    // Time from the reader's start to the end of the first frame; none: no limit.
    std::optional<std::chrono::milliseconds> firstFrameTimeout;
    // Time from the first byte of a frame to its last; none: no limit. Silence between
    // frames is not limited.
    std::optional<std::chrono::milliseconds> frameTimeout;
    // Where the bytes of a frame larger than the reader's own chunk are reserved;
    // nullptr: nowhere, the frame size limit is the only bound.
    STWIPCFrameBudget* budget = nullptr;
    // Objects one frame may decode to (see STWMessagePackDecode).
    size_t maxObjects = STWMessagePackMaxObjects;
};

// Reads frames from a stream socket, for one thread at a time. Reads are buffered: one
// recv may carry several frames, or a piece of one. The buffer is a chunk of 64 KiB,
// taken when bytes arrive and freed whenever no unread byte is left, so a waiting
// connection holds none. A frame longer than that gets a buffer of exactly its size when
// its bytes outgrow the chunk, reserved from the budget first; a length that is merely
// announced costs nothing. Waits for data are poll() calls with the deadline that
// applies.
class STWFrameReader {
public:
    explicit STWFrameReader(int fd, STWFrameReaderLimits limits = {});
    ~STWFrameReader();
    STWFrameReader(const STWFrameReader&) = delete;
    STWFrameReader& operator=(const STWFrameReader&) = delete;

    // Frame: `frame` holds the next frame. EndOfStream: the peer closed the connection
    // cleanly between frames. Error: a read failed (errno kept), the connection ended
    // inside a frame, a deadline passed (ETIMEDOUT), the budget had no room for the
    // frame (ENOBUFS), or a frame was oversized or broken; the stream cannot be resumed
    // after an Error and the connection should be closed. `reason` (optional) explains
    // an Error.
    STWFrameReadResult read(STWFrame& frame, std::string* reason);

private:
    bool _fill(size_t* received, std::string* reason);
    bool _waitForData(std::string* reason);
    bool _resize(size_t capacity, std::string* reason);

    const int _fd;
    const STWFrameReaderLimits _limits;
    std::unique_ptr<char[]> _buffer;
    size_t _capacity = 0;
    size_t _reserved = 0; // taken from the budget: the capacity beyond one chunk
    size_t _start = 0;    // first unconsumed byte
    size_t _end = 0;      // end of the bytes received
    std::optional<std::chrono::steady_clock::time_point> _firstFrameDeadline;
    std::optional<std::chrono::steady_clock::time_point> _frameDeadline; // of the frame begun
};

// Writes a whole encoded frame, handling partial writes and EINTR, without SIGPIPE
// (MSG_NOSIGNAL). false with errno kept on failure.
bool STWFrameWrite(int fd, std::string_view encodedFrame);
