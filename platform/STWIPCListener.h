// The request socket: a Unix stream socket (handed over by the service manager, or bound
// at ROOT/run/stowly/stowlyd.sock), one thread per connection. Each connection delivers
// its requests one at a time and in order; connections run concurrently. Bad input (an
// oversized frame, broken MessagePack, a body that is not a map, an unknown frame kind)
// is logged and closes that connection only.
#pragma once

#include "common/STWError.h"
#include "common/STWValue.h"
#include "platform/STWPeerConnection.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <thread>

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
    };

    STWIPCListener(Options options, ConnectionHandler onConnection, MessageHandler onMessage);
    ~STWIPCListener();

    // Binds (or adopts) the socket and starts accepting on its own thread.
    bool start(STWErrorRef* error);
    // Stops accepting and shuts down every open connection; returns when the accept
    // thread has ended. Requests already being handled run to their end.
    void stop();

    bool isSocketActivated() const { return _socketActivated; }
    size_t connectionCount() const;
    // When the last connection opened or closed.
    std::chrono::steady_clock::time_point lastConnectionChange() const;

private:
    void _acceptLoop();
    void _serve(std::shared_ptr<STWPeerConnection> peer);
    bool _handleHello(const std::shared_ptr<STWPeerConnection>& peer, uint64_t id, const STWValue::Dictionary& body,
                      bool afterRequest);
    void _connectionChanged(const std::shared_ptr<STWPeerConnection>& peer, bool added);

    const Options _options;
    const ConnectionHandler _onConnection;
    const MessageHandler _onMessage;
    int _listenFD = -1;
    bool _socketActivated = false;
    std::atomic<bool> _stopping{false};
    std::thread _acceptThread;

    mutable std::mutex _lock;
    std::condition_variable _connectionsGone;
    std::set<std::shared_ptr<STWPeerConnection>> _lock_connections;
    std::chrono::steady_clock::time_point _lock_lastConnectionChange = std::chrono::steady_clock::now();
};
