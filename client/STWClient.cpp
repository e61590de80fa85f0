#include "client/STWClient.h"

#include "common/STWException.h"

#include "common/STWLog.h"
#include "common/STWIPCFrame.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <exception>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

// Errors are handed to the caller, who decides whether they are worth logging; a client
// that polls a daemon which is not running should not fill the log with refused connects.
#define CLIENT_ERROR(code, ...) STW_POSIX_ERROR_NOLOG(code, __VA_ARGS__)

struct STWClient::Waiter {
    std::condition_variable wakeUp;
    bool done = false;
    std::optional<STWValue::Dictionary> reply;
};

namespace {

// A time-out this long means "no time-out"; it also keeps now() + timeout from overflowing.
constexpr std::chrono::milliseconds kForever = std::chrono::hours(24 * 365);

std::optional<std::chrono::steady_clock::time_point> deadlineAfter(std::chrono::milliseconds timeout) {
    if (timeout >= kForever)
        return std::nullopt;
    return std::chrono::steady_clock::now() + std::max(timeout, std::chrono::milliseconds(0));
}

// Milliseconds left for poll(): -1 without a deadline, 0 once it has passed.
int pollTimeout(std::optional<std::chrono::steady_clock::time_point> deadline) {
    if (!deadline)
        return -1;
    auto left = std::chrono::ceil<std::chrono::milliseconds>(*deadline - std::chrono::steady_clock::now());
    return static_cast<int>(std::clamp<int64_t>(left.count(), 0, 24 * 3600 * 1000));
}

} // namespace

std::filesystem::path STWClient::defaultSocketPath() {
    return "/run/stowly/stowlyd.sock";
}

std::filesystem::path STWClient::socketPathForRoot(const std::filesystem::path& root) {
    return root / "run/stowly/stowlyd.sock";
}

std::unique_ptr<STWClient> STWClient::connect(const std::filesystem::path& socketPath, STWErrorRef* error) {
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    const std::string& path = socketPath.native();
    if (path.empty() || path.size() >= sizeof address.sun_path) {
        STWSetError(error, CLIENT_ERROR(ENAMETOOLONG, "Socket path %@ does not fit a socket address", path));
        return nullptr;
    }
    memcpy(address.sun_path, path.data(), path.size());

    int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0) {
        STWSetError(error, CLIENT_ERROR(errno, "Failed to create a socket"));
        return nullptr;
    }
    if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        int code = errno;
        if (code == EINTR) {
            // The connection goes on in the background; wait for its outcome.
            pollfd p{fd, POLLOUT, 0};
            while (poll(&p, 1, -1) < 0 && errno == EINTR) {
            }
            socklen_t length = sizeof code;
            if (getsockopt(fd, SOL_SOCKET, SO_ERROR, &code, &length) != 0)
                code = errno;
        }
        if (code != 0) {
            close(fd);
            STWSetError(error, CLIENT_ERROR(code, "Failed to connect to %@", path));
            return nullptr;
        }
    }
    std::unique_ptr<STWClient> client;
    try {
        client.reset(new STWClient(fd));
    } catch (...) {
        close(fd);
        STWSetError(error, STWErrorForCurrentException(__func__, __LINE__, STWExceptionReport::None));
        return nullptr;
    }
    try {
        client->_reader = std::thread([c = client.get()] { c->_readReplies(); });
    } catch (...) {
        // The destructor closes the socket.
        STWSetError(error, STWErrorForCurrentException(__func__, __LINE__, STWExceptionReport::None));
        return nullptr;
    }
    return client;
}

STWClient::STWClient(int fd) : _fd(fd) {}

STWClient::~STWClient() {
    STWUniqueLock lock(_lock);
    _lock_failConnection(ECANCELED, "the client was closed");
    // Wakes the reader and any sender blocked on a full socket.
    shutdown(_fd, SHUT_RDWR);
    _callsDone.wait(lock.native(), [this] {
        _lock.assertHeld();
        return _activeCalls == 0;
    });
    lock.unlock();
    if (_reader.joinable())
        _reader.join();
    close(_fd);
}

std::optional<uint64_t> STWClient::hello(const STWValue::Dictionary& identity,
                                         std::chrono::milliseconds timeout, STWErrorRef* error) {
    std::optional<STWValue::Dictionary> reply;
    try {
        reply = _exchange(STWFrameKindHello, identity, timeout, error);
    } catch (...) {
        STWSetError(error, STWErrorForCurrentException(__func__, __LINE__, STWExceptionReport::None));
    }
    if (!reply)
        return std::nullopt;
    std::optional<uint64_t> replyError = STWDictionaryUInt64(*reply, "ReplyError");
    if (!replyError) {
        STWSetError(error, CLIENT_ERROR(EBADMSG, "Reply to hello without ReplyError: %@",
                                        STWDescribeDictionary(*reply)));
        return std::nullopt;
    }
    return replyError;
}

std::optional<STWValue::Dictionary> STWClient::sendMessage(const STWValue::Dictionary& message,
                                                           std::chrono::milliseconds timeout,
                                                           STWErrorRef* error) {
    try {
        return _exchange(STWFrameKindRequest, message, timeout, error);
    } catch (...) {
        STWSetError(error, STWErrorForCurrentException(__func__, __LINE__, STWExceptionReport::None));
        return std::nullopt;
    }
}

bool STWClient::_waitToWrite(std::optional<Clock::time_point> deadline) {
    STWUniqueLock guard(_writeStateLock);
    auto free = [&] {
        _writeStateLock.assertHeld();
        return !_writing;
    };
    if (deadline ? !_writerDone.wait_until(guard.native(), *deadline, free)
                 : (_writerDone.wait(guard.native(), free), false))
        return false;
    _writing = true;
    return true;
}

void STWClient::_doneWriting() {
    {
        STWLockGuard guard(_writeStateLock);
        _writing = false;
    }
    _writerDone.notify_one();
}

std::optional<STWValue::Dictionary> STWClient::_exchange(uint64_t kind, const STWValue::Dictionary& body,
                                                         std::chrono::milliseconds timeout,
                                                         STWErrorRef* error) {
    std::optional<Clock::time_point> deadline = deadlineAfter(timeout);
    uint64_t id;
    auto waiter = std::make_shared<Waiter>();
    {
        STWLockGuard guard(_lock);
        if (_failure) {
            STWSetError(error, _lock_connectionError());
            return std::nullopt;
        }
        id = _nextID++;
        _waiters.emplace(id, waiter);
        ++_activeCalls;
    }
    // Whatever happens below, exceptions included, the id is given up and the destructor
    // may go on.
    struct Leave {
        STWClient* client;
        uint64_t id;
        ~Leave() {
            STWLockGuard guard(client->_lock);
            client->_waiters.erase(id);
            if (--client->_activeCalls == 0)
                client->_callsDone.notify_all();
        }
    } leave{this, id};

    std::string frame = STWFrameEncode(kind, id, body);
    if (frame.size() - STWFrameHeaderSize > STWFrameMaxSize) {
        STWSetError(error, CLIENT_ERROR(EMSGSIZE, "Message of %zu bytes is over the frame limit",
                                        frame.size() - STWFrameHeaderSize));
        return std::nullopt;
    }

    if (!_waitToWrite(deadline)) {
        STWSetError(error, CLIENT_ERROR(ETIMEDOUT, "Timed out waiting to send request %llu", id));
        return std::nullopt;
    }
    size_t sent = 0;
    if (!_writeFrame(frame, deadline, &sent)) {
        int code = errno;
        _doneWriting();
        STWLockGuard guard(_lock);
        // A frame cut short leaves the daemon reading our next frame from its middle:
        // this connection is finished.
        if (sent > 0 && sent < frame.size()) {
            _lock_failConnection(code, "a request was only partly sent");
            shutdown(_fd, SHUT_RDWR);
        }
        if (_failure)
            STWSetError(error, _lock_connectionError());
        else if (code == EPIPE || code == ECONNRESET)
            // The daemon hung up. The reader fails the other callers once it reaches
            // the end of the stream, after the replies that came before it.
            STWSetError(error, CLIENT_ERROR(ECONNRESET, "The daemon closed the connection"));
        else
            STWSetError(error, CLIENT_ERROR(code, "Failed to send request %llu", id));
        return std::nullopt;
    }
    _doneWriting();

    STWUniqueLock lock(_lock);
    while (!waiter->done) {
        if (!deadline) {
            waiter->wakeUp.wait(lock.native());
        } else if (waiter->wakeUp.wait_until(lock.native(), *deadline) == std::cv_status::timeout && !waiter->done) {
            STWSetError(error, CLIENT_ERROR(ETIMEDOUT, "No reply to request %llu in %lld ms", id,
                                            static_cast<long long>(timeout.count())));
            return std::nullopt;
        }
    }
    if (!waiter->reply) {
        STWSetError(error, _lock_connectionError());
        return std::nullopt;
    }
    return std::move(waiter->reply);
}

// Sends without blocking past the deadline. `sent` tells how much of the frame went out.
bool STWClient::_writeFrame(const std::string& frame, std::optional<Clock::time_point> deadline,
                            size_t* sent) {
    while (*sent < frame.size()) {
        ssize_t n = send(_fd, frame.data() + *sent, frame.size() - *sent, MSG_NOSIGNAL | MSG_DONTWAIT);
        if (n >= 0) {
            *sent += static_cast<size_t>(n);
            continue;
        }
        if (errno == EINTR)
            continue;
        if (errno != EAGAIN && errno != EWOULDBLOCK)
            return false;
        int wait = pollTimeout(deadline);
        if (wait == 0) {
            errno = ETIMEDOUT;
            return false;
        }
        pollfd p{_fd, POLLOUT, 0};
        if (poll(&p, 1, wait) < 0 && errno != EINTR)
            return false;
    }
    return true;
}

void STWClient::_readReplies() {
    STWFrameReader reader(_fd);
    for (;;) {
        STWFrame frame;
        std::string reason;
        STWFrameReadResult result = reader.read(frame, &reason);
        if (result != STWFrameReadResult::Frame) {
            int code = result == STWFrameReadResult::EndOfStream ? ECONNRESET : errno;
            if (result == STWFrameReadResult::EndOfStream)
                reason = "the daemon closed the connection";
            STWLockGuard guard(_lock);
            _lock_failConnection(code ? code : EPROTO, reason);
            return;
        }
        if (frame.kind != STWFrameKindReply) {
            STW_LOG_DEBUG(STWLogCategory::Unspecified,
                          "Ignoring frame of kind %llu (id %llu) from the daemon", frame.kind, frame.id);
            continue;
        }
        STWLockGuard guard(_lock);
        auto it = _waiters.find(frame.id);
        if (it == _waiters.end() || it->second->done) {
            // The caller gave up on it.
            STW_LOG_DEBUG(STWLogCategory::Unspecified, "Dropping reply %llu that nobody waits for", frame.id);
            continue;
        }
        it->second->reply = std::move(frame.body);
        it->second->done = true;
        it->second->wakeUp.notify_one();
    }
}

void STWClient::_lock_failConnection(int code, std::string reason) {
    if (_failure)
        return;
    _failure = code;
    _failureReason = std::move(reason);
    for (auto& [id, waiter] : _waiters) {
        waiter->done = true;
        waiter->wakeUp.notify_one();
    }
}

STWErrorRef STWClient::_lock_connectionError() const {
    return CLIENT_ERROR(_failure, "Connection to stowlyd failed: %@", _failureReason);
}
