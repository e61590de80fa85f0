#include "platform/STWIPCFrame.h"

#include "common/STWMessagePack.h"

#include <cerrno>
#include <cstring>
#include <sys/socket.h>

namespace {

// Most messages are small; this is what one recv asks for at least.
constexpr size_t kReadChunk = 64 * 1024;
// A buffer that once held a large frame is given back when it empties, so an idle
// connection does not keep megabytes.
constexpr size_t kRetainedBufferSize = 1024 * 1024;

bool fail(std::string* reason, std::string why) {
    if (reason)
        *reason = std::move(why);
    return false;
}

} // namespace

std::string STWFrameEncode(uint64_t kind, uint64_t id, const STWValue::Dictionary& body) {
    std::string frame(STWFrameHeaderSize, '\0');
    frame.push_back(static_cast<char>(0x93)); // fixarray of three
    STWMessagePackAppend(frame, STWValue(kind));
    STWMessagePackAppend(frame, STWValue(id));
    STWMessagePackAppendDictionary(frame, body);
    auto length = static_cast<uint32_t>(frame.size() - STWFrameHeaderSize);
    for (size_t i = 0; i < STWFrameHeaderSize; ++i)
        frame[i] = static_cast<char>(length >> (8 * i));
    return frame;
}

std::optional<STWFrame> STWFrameDecode(std::string_view payload, std::string* reason) {
    std::optional<STWValue> value = STWMessagePackDecode(payload, reason);
    if (!value)
        return std::nullopt;
    STWValue::Array* array = value->mutableArray();
    if (!array || array->size() != 3) {
        fail(reason, "frame is not an array of three");
        return std::nullopt;
    }
    std::optional<uint64_t> kind = (*array)[0].uint64Value();
    std::optional<uint64_t> id = (*array)[1].uint64Value();
    STWValue::Dictionary* body = (*array)[2].mutableDictionary();
    if (!kind || !id) {
        fail(reason, "frame kind or id is not an unsigned integer");
        return std::nullopt;
    }
    if (!body) {
        fail(reason, "frame body is not a map");
        return std::nullopt;
    }
    return STWFrame{*kind, *id, std::move(*body)};
}

STWFrameReader::STWFrameReader(int fd) : _fd(fd) {}

STWFrameReadResult STWFrameReader::read(STWFrame& frame, std::string* reason) {
    for (;;) {
        size_t available = _end - _start;
        if (available >= STWFrameHeaderSize) {
            const auto* header = reinterpret_cast<const unsigned char*>(_buffer.data() + _start);
            uint32_t length = header[0] | header[1] << 8 | header[2] << 16 | uint32_t(header[3]) << 24;
            if (length > STWFrameMaxSize) {
                fail(reason, "frame of " + std::to_string(length) + " bytes is over the limit");
                errno = EMSGSIZE;
                return STWFrameReadResult::Error;
            }
            if (available >= STWFrameHeaderSize + length) {
                std::string_view payload(_buffer.data() + _start + STWFrameHeaderSize, length);
                _start += STWFrameHeaderSize + length;
                std::optional<STWFrame> decoded = STWFrameDecode(payload, reason);
                if (_start == _end) {
                    _start = _end = 0;
                    if (_buffer.size() > kRetainedBufferSize)
                        std::vector<char>().swap(_buffer);
                }
                if (!decoded) {
                    errno = EBADMSG;
                    return STWFrameReadResult::Error;
                }
                frame = std::move(*decoded);
                return STWFrameReadResult::Frame;
            }
        }
        size_t received = 0;
        if (!_fill(&received, reason))
            return STWFrameReadResult::Error;
        if (received == 0) {
            if (_start == _end)
                return STWFrameReadResult::EndOfStream;
            fail(reason, "connection closed inside a frame");
            errno = ECONNRESET;
            return STWFrameReadResult::Error;
        }
    }
}

// Receives what is there (at least one byte, or end of stream) after the buffered bytes;
// `received` is 0 only at the end of the stream. The buffered bytes may move to the front
// first, so the caller cannot tell what came from the size of the buffer.
bool STWFrameReader::_fill(size_t* received, std::string* reason) {
    if (_start > 0) {
        // Move the unconsumed tail to the front instead of growing.
        memmove(_buffer.data(), _buffer.data() + _start, _end - _start);
        _end -= _start;
        _start = 0;
    }
    if (_buffer.size() - _end < kReadChunk)
        _buffer.resize(std::max(_buffer.size() * 2, _end + kReadChunk));
    for (;;) {
        ssize_t n = recv(_fd, _buffer.data() + _end, _buffer.size() - _end, 0);
        if (n >= 0) {
            *received = static_cast<size_t>(n);
            _end += *received;
            return true;
        }
        if (errno == EINTR)
            continue;
        int saved = errno;
        fail(reason, std::string("recv: ") + strerror(saved));
        errno = saved;
        return false;
    }
}

bool STWFrameWrite(int fd, std::string_view encodedFrame) {
    const char* p = encodedFrame.data();
    size_t left = encodedFrame.size();
    while (left > 0) {
        ssize_t n = send(fd, p, left, MSG_NOSIGNAL);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return false;
        }
        p += n;
        left -= static_cast<size_t>(n);
    }
    return true;
}
