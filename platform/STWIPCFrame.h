// Frames of the request channel, shared by the daemon's listener and libstowly.
//
// On the stream socket every frame is a 4-byte little-endian payload length followed by
// that many bytes of MessagePack: the array [kind, id, body]. The client picks `id` and
// the daemon echoes it in the reply, since replies may come out of order. The payload is
// limited to STWFrameMaxSize; a longer declared length is refused before the payload is
// read, so a peer cannot make the reader allocate more than that.
#pragma once

#include "common/STWValue.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

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
// unsigned integers, body a map. Unknown kinds are returned as they are (the receiver
// decides).
std::optional<STWFrame> STWFrameDecode(std::string_view payload, std::string* reason);

enum class STWFrameReadResult { Frame, EndOfStream, Error };

// Reads frames from a blocking stream socket, for one thread at a time. Reads are
// buffered: one recv may carry several frames, or a piece of one. The buffer grows with
// the data that has actually arrived, never with the length a peer merely declares.
class STWFrameReader {
public:
    explicit STWFrameReader(int fd);

    // Frame: `frame` holds the next frame. EndOfStream: the peer closed the connection
    // cleanly between frames. Error: a read failed (errno kept), the connection ended
    // inside a frame, or a frame was oversized or broken; the stream cannot be resumed
    // after an Error and the connection should be closed. `reason` (optional) explains
    // an Error.
    STWFrameReadResult read(STWFrame& frame, std::string* reason);

private:
    bool _fill(size_t* received, std::string* reason);

    int _fd;
    std::vector<char> _buffer;
    size_t _start = 0; // first unconsumed byte
    size_t _end = 0;   // end of the bytes received
};

// Writes a whole encoded frame, handling partial writes and EINTR, without SIGPIPE
// (MSG_NOSIGNAL). false with errno kept on failure.
bool STWFrameWrite(int fd, std::string_view encodedFrame);
