// The upcall socket: a Unix SOCK_SEQPACKET socket at ROOT/run/stowly/upcall.sock, mode
// 0600 so that only root (which stands for the kernel) reaches it, or the socket the
// service manager passed under the name "upcall" (stowlyd-upcall.socket), so that an
// upcall starts a daemon that exited when idle.
//
// Each packet is one upcall (see STWKernTransport.h). Upcalls of every connection are
// served on one serial queue, one at a time, in the order each connection sent them. A
// connection is closed when its peer sends what no routine answers, when its packet is
// larger than STWUpcallMaxPacketSize, or when its reply cannot be sent at once (a peer that
// does not read its replies holds nothing up).
//
// Threads: the event loop accepts, watches the connections (edge-triggered: it only hands
// a connection that received something to the queue) and is the only thread that touches
// the connection table; the queue reads every packet that arrived, serves and replies, and
// asks the loop to drop a connection that is to close. The object lives for the process
// once started.
#pragma once

#include "common/STWError.h"
#include "common/STWFileDescriptor.h"
#include "platform/STWEventLoop.h"
#include "platform/STWPeerConnection.h"
#include "platform/STWQueue.h"

#include <filesystem>
#include <map>
#include <memory>

// The largest request packet: the layout and a request buffer of 1 MiB, far more than the
// identifiers and groups of one process take.
inline constexpr size_t STWUpcallMaxPacketSize = 56 + (1u << 20);
// Connections at once; the kernel needs one, tests and tools a few more.
inline constexpr size_t STWUpcallMaxConnections = 64;

class STWUpcallListener {
public:
    STWUpcallListener(std::filesystem::path socketPath, std::shared_ptr<STWQueue> queue);
    STWUpcallListener(const STWUpcallListener&) = delete;
    STWUpcallListener& operator=(const STWUpcallListener&) = delete;

    // Takes the socket the service manager passed, or binds and listens at the path.
    bool checkIn(STWErrorRef* error);
    // Accepts on `loop` from when it runs. Where the loop runs, before it does.
    bool resume(STWEventLoop& loop, STWErrorRef* error);
    // Stops accepting and closes every connection (see STWKernServerStop).
    void stop();

private:
    // What the queue keeps of a connection: only the queue touches it.
    struct Peer {
        std::shared_ptr<STWPeerConnection> connection;
        uint32_t sequence = 0; // of the next packet, for the receiver's trailer
    };
    struct Connection {
        std::shared_ptr<Peer> peer;
        STWEventLoop::Source readable;
    };
    enum class PacketResult { Served, NoneWaiting, Close };

    int _socketFromServiceManager();
    void _acceptPending();
    void _packetsArrived(uint64_t serial);
    // On the queue: reads one packet and answers it.
    PacketResult _serveOnePacket(Peer& peer);
    void _close(uint64_t serial);

    const std::filesystem::path _socketPath;
    const std::shared_ptr<STWQueue> _queue;
    STWEventLoop* _loop = nullptr;
    STWFileDescriptor _listenFD;
    bool _socketActivated = false;
    STWEventLoop::Source _acceptSource;
    // The loop's thread only.
    std::map<uint64_t, std::unique_ptr<Connection>> _connections;
};
