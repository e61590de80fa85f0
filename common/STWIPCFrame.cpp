#include "common/STWIPCFrame.h"

#include "common/STWSystemCall.h"

#include "common/STWFormat.h"

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>

namespace {

using Clock = std::chrono::steady_clock;

// The reader's own buffer while a frame arrives: most messages fit, and this is what one
// recv asks for at least. Only larger frames take from the budget.
constexpr size_t kReadChunk = 64 * 1024;

bool fail(std::string* reason, std::string why) {
    if (reason)
        *reason = std::move(why);
    return false;
}

uint32_t frameLength(const char* header) {
    const auto* h = reinterpret_cast<const unsigned char*>(header);
    return h[0] | h[1] << 8 | h[2] << 16 | uint32_t(h[3]) << 24;
}

double seconds(std::chrono::milliseconds duration) {
    return duration.count() / 1000.0;
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

std::optional<STWFrame> STWFrameDecode(std::string_view payload, std::string* reason, size_t maxObjects) {
    std::optional<STWValue> value = STWMessagePackDecode(payload, reason, maxObjects);
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

STWFrameReader::STWFrameReader(int fd, STWFrameReaderLimits limits) : _fd(fd), _limits(limits) {
    if (_limits.firstFrameTimeout)
        _firstFrameDeadline = Clock::now() + *_limits.firstFrameTimeout;
}

STWFrameReader::~STWFrameReader() {
    if (_reserved > 0)
        _limits.budget->release(_reserved);
}

STWFrameReadResult STWFrameReader::read(STWFrame& frame, std::string* reason) {
    for (;;) {
        size_t available = _end - _start;
        if (available >= STWFrameHeaderSize) {
            uint32_t length = frameLength(_buffer.get() + _start);
            if (length > STWFrameMaxSize) {
                fail(reason, "frame of " + std::to_string(length) + " bytes is over the limit");
                errno = EMSGSIZE;
                return STWFrameReadResult::Error;
            }
            if (available >= STWFrameHeaderSize + length) {
                std::string_view payload(_buffer.get() + _start + STWFrameHeaderSize, length);
                std::optional<STWFrame> decoded = STWFrameDecode(payload, reason, _limits.maxObjects);
                _start += STWFrameHeaderSize + length;
                _firstFrameDeadline.reset();
                _frameDeadline.reset();
                if (_start == _end) {
                    // The buffer of a large frame goes back at once; one chunk stays for
                    // the next request, so that a busy connection neither allocates nor
                    // waits in poll() before each read. A connection that has sent
                    // nothing yet holds none.
                    _start = _end = 0;
                    if (_capacity > kReadChunk)
                        _resize(kReadChunk, nullptr);
                } else if (_limits.frameTimeout) {
                    _frameDeadline = Clock::now() + *_limits.frameTimeout; // the next one has begun
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
    if (!_waitForData(reason))
        return false;
    if (_start > 0) {
        memmove(_buffer.get(), _buffer.get() + _start, _end - _start);
        _end -= _start;
        _start = 0;
    }
    size_t needed = kReadChunk;
    if (_end >= STWFrameHeaderSize)
        needed = std::max(needed, STWFrameHeaderSize + frameLength(_buffer.get()));
    if (_capacity < needed && !_resize(needed, reason))
        return false;
    for (;;) {
        ssize_t n = recv(_fd, _buffer.get() + _end, _capacity - _end, 0);
        if (n >= 0) {
            if (_end == 0 && n > 0 && _limits.frameTimeout)
                _frameDeadline = Clock::now() + *_limits.frameTimeout;
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

// Returns once the socket has something to say (data, its end or an error: recv tells
// which); fails with ETIMEDOUT when the deadline that applies passes first. Without a
// deadline a reader that holds a buffer leaves the waiting to recv; one that holds none
// waits here, so that a peer takes memory only once it sends.
bool STWFrameReader::_waitForData(std::string* reason) {
    std::optional<Clock::time_point> deadline = _frameDeadline;
    bool first = _firstFrameDeadline && (!deadline || *_firstFrameDeadline < *deadline);
    if (first)
        deadline = _firstFrameDeadline;
    if (!deadline && _buffer)
        return true;
    for (;;) {
        int64_t left = -1;
        if (deadline)
            left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - Clock::now()).count();
        if (deadline && left <= 0) {
            fail(reason,
                 first ? STWFormat("no frame within %g seconds of connecting",
                                   seconds(*_limits.firstFrameTimeout))
                       : STWFormat("frame unfinished after %g seconds", seconds(*_limits.frameTimeout)));
            errno = ETIMEDOUT;
            return false;
        }
        pollfd p{_fd, POLLIN, 0};
        int ready = poll(&p, 1, static_cast<int>(std::min<int64_t>(left, INT_MAX))); // -1: no deadline
        if (ready > 0)
            return true;
        if (ready < 0 && errno != EINTR) {
            int saved = errno;
            fail(reason, std::string("poll: ") + strerror(saved));
            errno = saved;
            return false;
        }
    }
}

// Gives the buffer room for `capacity` bytes (0: frees it), keeping the unconsumed bytes,
// which start at 0. What goes beyond one chunk is reserved from the budget first.
bool STWFrameReader::_resize(size_t capacity, std::string* reason) {
    size_t reserve = _limits.budget && capacity > kReadChunk ? capacity - kReadChunk : 0;
    if (reserve > _reserved && !_limits.budget->reserve(reserve - _reserved)) {
        fail(reason,
             STWFormat("no room for a frame of %zu bytes (%zu of %zu bytes held by unfinished frames)",
                       capacity - STWFrameHeaderSize, _limits.budget->reserved(), _limits.budget->limit()));
        errno = ENOBUFS;
        return false;
    }
    // Not value-initialised: only what recv writes is ever touched.
    std::unique_ptr<char[]> buffer(capacity > 0 ? new char[capacity] : nullptr);
    if (_end > 0)
        memcpy(buffer.get(), _buffer.get(), _end);
    _buffer = std::move(buffer);
    _capacity = capacity;
    if (reserve < _reserved)
        _limits.budget->release(_reserved - reserve);
    _reserved = reserve;
    return true;
}

bool STWFrameWrite(int fd, std::string_view encodedFrame) {
    const char* p = encodedFrame.data();
    size_t left = encodedFrame.size();
    while (left > 0) {
        ssize_t n = STWRetryOnEINTR([&] { return send(fd, p, left, MSG_NOSIGNAL); });
        if (n < 0)
            return false;
        p += n;
        left -= static_cast<size_t>(n);
    }
    return true;
}
