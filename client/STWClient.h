// libstowly: a connection to stowlyd's request socket.
//
// Used by stowlyctl, the end-to-end tests, the benchmarks and any program that asks the
// daemon for containers. One STWClient is one connection. Any number of threads may send
// on it at once: each request gets its own frame id, and a reader thread hands every
// reply to the caller waiting for that id, since the daemon may answer out of order.
//
// Failures are POSIX-domain errors: the errno of a failed connect or send, ETIMEDOUT when
// no reply came in time, ECONNRESET when the daemon closed the connection (every waiting
// caller fails at once), EPROTO or EBADMSG when the daemon sent something that is not a
// frame, EMSGSIZE for a message over the frame limit, ECANCELED when the client is being
// destroyed. Once the connection has failed, every later call fails with the same error;
// connect again to go on.
#pragma once

#include "common/STWError.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <unordered_map>

class STWClient {
public:
    static std::filesystem::path defaultSocketPath(); // "/run/stowly/stowlyd.sock"
    // The socket of a daemon started with --root `root`.
    static std::filesystem::path socketPathForRoot(const std::filesystem::path& root);

    static std::unique_ptr<STWClient> connect(const std::filesystem::path& socketPath, STWErrorRef* error);

    // Closes the connection. Calls still waiting on other threads fail with ECANCELED and
    // have returned before the destructor does.
    ~STWClient();
    STWClient(const STWClient&) = delete;
    STWClient& operator=(const STWClient&) = delete;

    // Developer-mode hello, sent before any request: body keys "CodeSigningIdentifier"
    // (string), "Entitlements" (map), "Sandboxed" (bool), "PersonaUniqueString" (string,
    // optional). Returns the reply's "ReplyError" (1 accepted, 55 refused; the daemon
    // closes the connection after refusing), or nullopt with `error` set on I/O failure
    // or time-out.
    std::optional<uint64_t> hello(const STWValue::Dictionary& identity, std::chrono::milliseconds timeout,
                                  STWErrorRef* error);

    // Sends a request (the message dictionary with "Command" and its keys) and waits for
    // the reply with the same id. A time-out abandons the request: its reply, should it
    // come later, is dropped.
    std::optional<STWValue::Dictionary> sendMessage(const STWValue::Dictionary& message,
                                                    std::chrono::milliseconds timeout, STWErrorRef* error);

private:
    struct Waiter;
    using Clock = std::chrono::steady_clock;

    explicit STWClient(int fd);
    std::optional<STWValue::Dictionary> _exchange(uint64_t kind, const STWValue::Dictionary& body,
                                                  std::chrono::milliseconds timeout, STWErrorRef* error);
    bool _writeFrame(const std::string& frame, std::optional<Clock::time_point> deadline, size_t* sent);
    void _readReplies();
    void _lock_failConnection(int code, std::string reason) STW_REQUIRES(_lock);
    STWErrorRef _lock_connectionError() const STW_REQUIRES(_lock);

    const int _fd;
    std::thread _reader;

    // Frames go out whole and one at a time: a sender waits (honouring its time-out) until
    // no other is writing. A flag under a mutex rather than a timed mutex, whose timed lock
    // ThreadSanitizer cannot follow.
    bool _waitToWrite(std::optional<Clock::time_point> deadline);
    void _doneWriting();
    STWMutex _writeStateLock;
    std::condition_variable _writerDone;
    bool _writing STW_GUARDED_BY(_writeStateLock) = false;

    // Guards the waiters (and what each holds), the ids and the connection's failure.
    mutable STWMutex _lock;
    std::unordered_map<uint64_t, std::shared_ptr<Waiter>> _waiters STW_GUARDED_BY(_lock);
    uint64_t _nextID STW_GUARDED_BY(_lock) = 1;
    int _failure STW_GUARDED_BY(_lock) = 0; // errno that ended the connection, 0 while it is up
    std::string _failureReason STW_GUARDED_BY(_lock);
    size_t _activeCalls STW_GUARDED_BY(_lock) = 0;
    std::condition_variable _callsDone;
};
