// Feeds any bytes to the request channel's decoders, as a hostile local process could:
// as one MessagePack object, as a frame payload, and as a stream of frames on a socket.
// Whatever decodes must encode again and decode back to the same value. The input is
// copied to memory of exactly its size so that any read past it is caught.
#include "common/STWMessagePack.h"
#include "common/STWIPCFrame.h"

#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>
#include <sys/socket.h>
#include <unistd.h>

namespace {

void require(bool condition, const char* what) {
    if (!condition) {
        fprintf(stderr, "ipc fuzzer: %s\n", what);
        abort();
    }
}

// Equal values, or the same NaN: a NaN is never == itself, but it must still come back
// with the same bits, which equal encodings show.
bool same(const STWValue& a, const STWValue& b) {
    return a == b || STWMessagePackEncode(a) == STWMessagePackEncode(b);
}

void checkValue(std::string_view input) {
    std::string reason;
    std::optional<STWValue> value = STWMessagePackDecode(input, &reason);
    if (!value) {
        require(!reason.empty(), "refusal without a reason");
        return;
    }
    std::string encoded = STWMessagePackEncode(*value);
    std::optional<STWValue> again = STWMessagePackDecode(encoded, &reason);
    require(again.has_value(), "a decoded value does not decode after encoding");
    require(same(*again, *value), "value changed on the way through the codec");
    // Our own encoding is canonical: encoding again gives the same bytes.
    require(STWMessagePackEncode(*again) == encoded, "encoding is not stable");
}

void checkFrame(std::string_view input) {
    std::optional<STWFrame> frame = STWFrameDecode(input, nullptr);
    if (!frame)
        return;
    std::string encoded = STWFrameEncode(frame->kind, frame->id, frame->body);
    uint32_t length = 0;
    for (int i = 3; i >= 0; --i)
        length = length << 8 | static_cast<unsigned char>(encoded[i]);
    require(length == encoded.size() - 4, "length prefix does not match the payload");
    std::optional<STWFrame> again = STWFrameDecode(std::string_view(encoded).substr(4), nullptr);
    require(again.has_value(), "a decoded frame does not decode after encoding");
    require(again->kind == frame->kind && again->id == frame->id, "frame header changed");
    require(same(STWValue(again->body), STWValue(frame->body)), "frame body changed");
}

// The input as a byte stream from a peer that then closes: the reader must end in a clean
// end of stream or an error, having read only whole frames.
void checkStream(std::string_view input) {
    int fds[2];
    require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0, "socketpair");
    // Larger inputs would not fit the socket buffer without a second thread.
    bool written = input.size() <= 64 * 1024 && STWFrameWrite(fds[1], input);
    close(fds[1]);
    if (written) {
        STWFrameReader reader(fds[0]);
        STWFrame frame;
        size_t frames = 0;
        STWFrameReadResult result;
        while ((result = reader.read(frame, nullptr)) == STWFrameReadResult::Frame)
            require(++frames <= input.size() / 5, "more frames than the input can hold");
        if (input.empty())
            require(result == STWFrameReadResult::EndOfStream, "empty stream is not a clean end");
    }
    close(fds[0]);
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::unique_ptr<char[]> memory(new char[size]);
    if (size)
        memcpy(memory.get(), data, size);
    std::string_view input(memory.get(), size);
    checkValue(input);
    checkFrame(input);
    checkStream(input);
    return 0;
}
