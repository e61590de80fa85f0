// An owned file descriptor that is closed when it goes out of scope.
//
// The file layer hands these out from its descriptor-relative operations (openBeneath)
// so that callers working inside containers cannot leak a descriptor on an early return;
// the platform layer keeps its sockets, eventfds and inotify instance in them.
#pragma once

#include <unistd.h>
#include <utility>

class STWFileDescriptor {
public:
    STWFileDescriptor() = default;
    explicit STWFileDescriptor(int fd) : _fd(fd) {}
    STWFileDescriptor(const STWFileDescriptor&) = delete;
    STWFileDescriptor& operator=(const STWFileDescriptor&) = delete;
    STWFileDescriptor(STWFileDescriptor&& other) noexcept : _fd(other.release()) {}
    STWFileDescriptor& operator=(STWFileDescriptor&& other) noexcept {
        if (this != &other)
            reset(other.release());
        return *this;
    }
    ~STWFileDescriptor() { reset(); }

    int get() const { return _fd; }
    bool isValid() const { return _fd >= 0; }
    explicit operator bool() const { return isValid(); }

    // Gives up ownership without closing.
    int release() { return std::exchange(_fd, -1); }
    void reset(int fd = -1) {
        // close() is not retried on EINTR: on Linux the descriptor is gone either way.
        if (_fd >= 0)
            ::close(_fd);
        _fd = fd;
    }

private:
    int _fd = -1;
};
