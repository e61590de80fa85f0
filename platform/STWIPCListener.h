// The request socket: a Unix stream socket (handed over by the service manager, or bound
// at ROOT/run/stowly/stowlyd.sock), one thread per connection. Each connection delivers
// its requests one at a time and in order; connections run concurrently. Bad input (an
// oversized frame, broken MessagePack, a body that is not a map, an unknown frame kind)
// is logged and closes that connection only.
//
// Anyone may connect, so every client is bounded: connections at once in all and per
// user (over a cap a connection is closed as soon as it is accepted), time to the first
// frame and inside each frame, bytes held for frames still arriving (one budget for all
// connections) and values a request may decode to.
//
// Threads: the event loop accepts, starts a thread per connection and joins the threads
// of connections that have ended (each one wakes the loop through an eventfd as it ends);
// connection threads read, dispatch and reply. `_lock` guards the connection table and
// counts, which both touch; nothing holds it across I/O.
#pragma once

#include "common/STWError.h"
#include "common/STWFileDescriptor.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"
#include "common/STWIPCFrameBudget.h"
#include "platform/STWEventLoop.h"
#include "platform/STWPeerConnection.h"
#include "platform/STWPlatformConfiguration.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <thread>

// Values one request frame may decode to. Requests are a handful of keys; this leaves
// room for long lists while a decoded request stays within a megabyte or two.
inline constexpr size_t STWIPCRequestMaxObjects = 1u << 14;

class STWIPCListener {
public:
    // Runs once for every new connection before its first frame is read (the daemon
    // waits there for its start-up to finish).
    using ConnectionHandler = std::function<void(const std::shared_ptr<STWPeerConnection>&)>;
    // Runs once per request on the connection's thread; the reply is sent through the peer.
    using MessageHandler =
        std::function<void(const std::shared_ptr<STWPeerConnection>&, uint64_t requestID, STWValue::Dictionary)>;

    struct Options {
        std::filesystem::path socketPath;
        // Accept hello frames that declare a client identity.
        bool developerMode = false;
        // Use a socket passed by the service manager when there is one.
        bool allowSocketActivation = true;
        // Connection caps left unset are derived from the descriptor limit in force when
        // the listener is made (see _resolveConnectionCaps).
        STWClientBounds bounds;
        // Runs on the loop after the threads of connections that closed were joined.
        std::function<void()> connectionsClosed;
    };

    STWIPCListener(Options options, ConnectionHandler onConnection, MessageHandler onMessage);
    // Stops, and waits for every connection thread, however long that takes: an owner
    // that cannot wait calls stop() itself and does not destroy a listener it failed.
    ~STWIPCListener();

    // Binds (or adopts) the socket and accepts on `loop` from when it runs. Called where
    // the loop runs, before it does.
    bool start(STWEventLoop& loop, STWErrorRef* error);
    // Stops accepting and shuts every connection down: no further request is read, and
    // the replies of requests still running are not sent. Waits up to `timeout` for the
    // connection threads to end and joins them; false (each one still running logged)
    // when some did not end in time. On the loop's thread, or once the loop has stopped.
    bool stop(std::chrono::steady_clock::duration timeout = std::chrono::seconds(10));

    bool isSocketActivated() const { return _socketActivated; }
    size_t connectionCount() const;
    // When the last connection opened or closed.
    std::chrono::steady_clock::time_point lastConnectionChange() const;

private:
    struct Connection {
        std::shared_ptr<STWPeerConnection> peer;
        std::thread thread;
        bool finished = false;
    };

    void _resolveConnectionCaps();
    int _socketFromServiceManager();
    void _acceptPending();
    void _connectionsEnded();
    bool _admit(int fd);
    void _startConnection(std::shared_ptr<STWPeerConnection> peer);
    void _reapFinishedConnections();
    void _serve(std::shared_ptr<STWPeerConnection> peer);
    bool _handleHello(const std::shared_ptr<STWPeerConnection>& peer, uint64_t id, const STWValue::Dictionary& body,
                      bool afterRequest);
    void _lock_connectionEnded(Connection& connection) STW_REQUIRES(_lock);

    const Options _options;
    const ConnectionHandler _onConnection;
    const MessageHandler _onMessage;
    size_t _maxConnections = 0;
    size_t _maxConnectionsPerUser = 0;
    STWIPCFrameBudget _frameBudget;
    STWFileDescriptor _listenFD;
    bool _socketActivated = false;
    std::atomic<bool> _stopping{false};
    // Written by a connection's thread as it ends, so that the loop joins it.
    STWFileDescriptor _endedFD;
    // Made in start(), used and destroyed where the loop runs.
    STWEventLoop::Source _acceptSource;
    STWEventLoop::Source _acceptRetry; // accepting again after a failure, such as no descriptors left
    STWEventLoop::Source _endedSource;

    mutable STWMutex _lock;
    std::condition_variable _connectionsGone;
    // By serial; an entry stays until the loop (or stop()) joins its thread.
    std::map<uint64_t, Connection> _lock_connections STW_GUARDED_BY(_lock);
    size_t _lock_openConnections STW_GUARDED_BY(_lock) = 0;
    std::map<uid_t, size_t> _lock_openConnectionsPerUser STW_GUARDED_BY(_lock);
    std::chrono::steady_clock::time_point _lock_lastConnectionChange STW_GUARDED_BY(_lock) =
        std::chrono::steady_clock::now();
};
