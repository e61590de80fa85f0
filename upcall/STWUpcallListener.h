// The upcall socket: a Unix SOCK_SEQPACKET socket at ROOT/run/stowly/upcall.sock, mode
// 0600 so that only root (which stands for the kernel) reaches it, or the socket the
// service manager passed under the name "upcall" (stowlyd-upcall.socket), so that an
// upcall starts a daemon that exited when idle.
//
// Each packet is one upcall (see STWKernTransport.h). Upcalls of every connection are
// served by one thread, "com.vorlane.stowlyd.upcall", one at a time, in the order each
// connection sent them and taking turns between connections. A connection is closed when
// its peer sends what no routine answers, when its packet is larger than
// STWUpcallMaxPacketSize, or when its reply cannot be sent at once (a peer that does not
// read its replies holds nothing up).
//
// Threads: the event loop accepts and hands each new connection over; the upcall thread
// owns the connections from then on, waits for their packets itself, serves and replies.
// An upcall waits for nobody else on its way: on the launch path, a hop through the event
// loop and a queue's worker cost more than the upcall's own work. Each packet is served
// under an IPC transaction, so idle exit never cuts one short. The object lives for the
// process once started.
#pragma once

#include "common/STWError.h"
#include "common/STWFileDescriptor.h"
#include "common/STWThreadSafety.h"
#include "platform/STWEventLoop.h"
#include "platform/STWPeerConnection.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <filesystem>
#include <memory>
#include <thread>
#include <vector>

// The largest request packet: the layout and a request buffer of 1 MiB, far more than the
// identifiers and groups of one process take.
inline constexpr size_t STWUpcallMaxPacketSize = 56 + (1u << 20);
// Connections at once; the kernel needs one, tests and tools a few more.
inline constexpr size_t STWUpcallMaxConnections = 64;

class STWUpcallListener {
public:
    explicit STWUpcallListener(std::filesystem::path socketPath);
    STWUpcallListener(const STWUpcallListener&) = delete;
    STWUpcallListener& operator=(const STWUpcallListener&) = delete;

    // Takes the socket the service manager passed, or binds and listens at the path.
    bool checkIn(STWErrorRef* error);
    // Starts the upcall thread and accepts on `loop` from when it runs. Where the loop
    // runs, before it does.
    bool resume(STWEventLoop& loop, STWErrorRef* error);
    // Stops accepting and tells the upcall thread to close every connection once the
    // upcall it serves (if any) is answered; true when the thread ended within `timeout`
    // (and was joined). On the event loop's thread, or once the loop has stopped.
    bool stop(std::chrono::steady_clock::duration timeout);

private:
    enum class PacketResult { Served, NoneWaiting, Close };

    int _socketFromServiceManager();
    void _acceptPending();
    // The upcall thread's loop.
    void _serve();
    // On the upcall thread: reads one packet and answers it; `sequence` numbers the
    // connection's packets for the receiver's trailer.
    PacketResult _serveOnePacket(const std::shared_ptr<STWPeerConnection>& connection, uint32_t& sequence);

    const std::filesystem::path _socketPath;
    STWFileDescriptor _listenFD;
    bool _socketActivated = false;
    STWEventLoop::Source _acceptSource;
    // The upcall thread waits on _epollFD for its connections and for _wakeFD, which says
    // that connections were handed over or that it is to stop.
    STWFileDescriptor _epollFD;
    STWFileDescriptor _wakeFD;
    std::thread _thread;
    std::atomic<size_t> _connectionCount{0};
    // The upcall thread's only: room for the largest packet, and the reply being built,
    // kept from one upcall to the next unless it grew large.
    std::vector<char> _packetBuffer;
    std::string _replyBuffer;

    STWMutex _handoverLock; // a leaf lock
    std::vector<std::shared_ptr<STWPeerConnection>> _handedOver STW_GUARDED_BY(_handoverLock);
    bool _stopping STW_GUARDED_BY(_handoverLock) = false;
    bool _finished STW_GUARDED_BY(_handoverLock) = false;
    std::condition_variable _finishedCondition;
};
