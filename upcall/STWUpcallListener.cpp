#include "upcall/STWUpcallListener.h"

#include "common/STWLog.h"
#include "platform/STWTransaction.h"
#include "upcall/STWKernTransport.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <map>
#include <pthread.h>
#include <string_view>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace {

// Room for the largest reply: a path or two for each group of a request buffer of the
// largest size. A packet beyond the send buffer cannot be sent at all.
constexpr int kReplySendBuffer = 16 << 20;
// What an ordinary reply needs, a few paths, with room to spare.
constexpr size_t kKeptReplyCapacity = 64 << 10;

} // namespace

STWUpcallListener::STWUpcallListener(std::filesystem::path socketPath) : _socketPath(std::move(socketPath)) {}

// The socket the service manager passed under the name "upcall", or -1.
int STWUpcallListener::_socketFromServiceManager() {
    char** names = nullptr;
    int count = sd_listen_fds_with_names(0, &names);
    int fd = -1;
    for (int i = 0; i < count; i++)
        if (names && names[i] && std::string_view(names[i]) == "upcall")
            fd = SD_LISTEN_FDS_START + i;
    for (int i = 0; names && i < count; i++)
        free(names[i]);
    free(names);
    if (fd >= 0 && sd_is_socket_unix(fd, SOCK_SEQPACKET, 1, nullptr, 0) <= 0) {
        STW_LOG_ERROR(STWLogCategory::Upcall,
                      "The upcall socket passed by the service manager is not a listening sequenced-packet socket");
        fd = -1;
    }
    return fd;
}

bool STWUpcallListener::checkIn(STWErrorRef* error) {
    if (int fd = _socketFromServiceManager(); fd >= 0) {
        if (fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK) != 0) {
            STWSetError(error, STW_POSIX_ERROR(errno, "Cannot make the passed upcall socket non-blocking"));
            return false;
        }
        _listenFD.reset(fd);
        _socketActivated = true;
        STW_LOG_NOTICE(STWLogCategory::Upcall, "Serving the upcall socket passed by the service manager");
        return true;
    }
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    if (_socketPath.native().size() >= sizeof address.sun_path) {
        STWSetError(error, STW_POSIX_ERROR(ENAMETOOLONG, "Socket path %@ is too long", _socketPath));
        return false;
    }
    memcpy(address.sun_path, _socketPath.c_str(), _socketPath.native().size() + 1);
    STWFileDescriptor socketFD(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
    if (!socketFD) {
        STWSetError(error, STW_POSIX_ERROR(errno, "socket() failed"));
        return false;
    }
    // The mode is the socket's before bind() makes its file, so there is no moment in which
    // anyone but root could connect. A file left by an earlier run is stale.
    unlink(_socketPath.c_str());
    if (fchmod(socketFD.get(), 0600) != 0 ||
        bind(socketFD.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
        listen(socketFD.get(), SOMAXCONN) != 0) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot listen on %@", _socketPath));
        return false;
    }
    _listenFD = std::move(socketFD);
    STW_LOG_NOTICE(STWLogCategory::Upcall, "Listening for upcalls on %@", _socketPath);
    return true;
}

bool STWUpcallListener::resume(STWEventLoop& loop, STWErrorRef* error) {
    _epollFD.reset(epoll_create1(EPOLL_CLOEXEC));
    _wakeFD.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    epoll_event wake{};
    wake.events = EPOLLIN;
    wake.data.fd = _wakeFD.get();
    if (!_epollFD || !_wakeFD || epoll_ctl(_epollFD.get(), EPOLL_CTL_ADD, _wakeFD.get(), &wake) != 0) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot watch upcall connections"));
        return false;
    }
    _acceptSource = loop.watchReadable(_listenFD.get(), [this] { _acceptPending(); });
    if (!_acceptSource) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot accept upcall connections on the event loop"));
        return false;
    }
    try {
        _thread = std::thread([this] { _serve(); });
    } catch (const std::system_error& e) {
        _acceptSource.reset();
        STWSetError(error, STW_POSIX_ERROR(e.code().value(), "Cannot start the upcall thread"));
        return false;
    }
    return true;
}

bool STWUpcallListener::stop(std::chrono::steady_clock::duration timeout) {
    _acceptSource.reset();
    if (_listenFD && !_socketActivated)
        unlink(_socketPath.c_str());
    _listenFD.reset();
    if (!_thread.joinable())
        return true;
    bool finished;
    {
        STWUniqueLock lock(_handoverLock);
        _stopping = true;
        uint64_t one = 1;
        if (write(_wakeFD.get(), &one, sizeof one) != sizeof one)
            STW_LOG_ERROR(STWLogCategory::Upcall, "Cannot tell the upcall thread to stop: %s",
                          strerror(errno));
        finished = _finishedCondition.wait_for(lock.native(), timeout, [&] {
            _handoverLock.assertHeld();
            return _finished;
        });
    }
    // One that is still serving is left to the daemon's exit.
    if (finished)
        _thread.join();
    return finished;
}

void STWUpcallListener::_acceptPending() {
    bool handedOver = false;
    for (int i = 0; i < 16; i++) {
        int fd = accept4(_listenFD.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            if (errno != EAGAIN)
                STW_LOG_ERROR(STWLogCategory::Upcall, "accept failed: %s", strerror(errno));
            break;
        }
        if (_connectionCount >= STWUpcallMaxConnections) {
            STW_LOG_ERROR(STWLogCategory::Upcall, "Refusing an upcall connection: %zu are open",
                          _connectionCount.load());
            close(fd);
            continue;
        }
        STWErrorRef error;
        auto peer = STWPeerConnection::adopt(fd, &error);
        if (!peer)
            continue;
        if (setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &kReplySendBuffer, sizeof kReplySendBuffer) != 0)
            setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &kReplySendBuffer, sizeof kReplySendBuffer);
        ++_connectionCount;
        STWLockGuard guard(_handoverLock);
        _handedOver.push_back(std::move(peer));
        handedOver = true;
    }
    uint64_t one = 1;
    if (handedOver && write(_wakeFD.get(), &one, sizeof one) != sizeof one)
        STW_LOG_ERROR(STWLogCategory::Upcall, "Cannot hand connections to the upcall thread: %s",
                      strerror(errno));
}

void STWUpcallListener::_serve() {
    pthread_setname_np(pthread_self(), "stowlyd.upcall");
    _packetBuffer.resize(STWUpcallMaxPacketSize);
    // A launch waits for every upcall: above the default, like user-initiated queues.
    setpriority(PRIO_PROCESS, static_cast<id_t>(gettid()), -5);
    struct Peer {
        std::shared_ptr<STWPeerConnection> connection;
        uint32_t sequence = 0; // of the next packet, for the receiver's trailer
    };
    std::map<int, Peer> peers; // by descriptor
    auto drop = [&](int fd) {
        epoll_ctl(_epollFD.get(), EPOLL_CTL_DEL, fd, nullptr);
        peers.erase(fd);
        --_connectionCount;
    };
    for (;;) {
        epoll_event events[16];
        int count = epoll_wait(_epollFD.get(), events, 16, -1);
        if (count < 0 && errno != EINTR)
            STW_FATAL("Cannot wait for upcalls: %s", strerror(errno));
        bool stopping = false;
        // Level-triggered: each connection with a packet waiting gets one turn per round.
        for (int i = 0; i < count; i++) {
            int fd = events[i].data.fd;
            if (fd == _wakeFD.get()) {
                uint64_t ignored;
                while (read(fd, &ignored, sizeof ignored) < 0 && errno == EINTR) {
                }
                std::vector<std::shared_ptr<STWPeerConnection>> arrived;
                {
                    STWLockGuard guard(_handoverLock);
                    arrived.swap(_handedOver);
                    stopping = _stopping;
                }
                for (auto& connection : arrived) {
                    int arrivedFD = connection->fd();
                    epoll_event event{};
                    event.events = EPOLLIN;
                    event.data.fd = arrivedFD;
                    if (epoll_ctl(_epollFD.get(), EPOLL_CTL_ADD, arrivedFD, &event) != 0) {
                        STW_LOG_ERROR(STWLogCategory::Upcall, "Cannot watch %@: %s", connection,
                                      strerror(errno));
                        --_connectionCount;
                        continue;
                    }
                    peers.emplace(arrivedFD, Peer{std::move(connection)});
                }
                continue;
            }
            auto it = peers.find(fd);
            if (it == peers.end())
                continue;
            STWTransaction::Scope serving;
            if (_serveOnePacket(it->second.connection, it->second.sequence) == PacketResult::Close)
                drop(fd);
        }
        if (stopping)
            break;
    }
    // Replies already sent stay sent; the peers only see their connections close.
    while (!peers.empty())
        drop(peers.begin()->first);
    STWLockGuard guard(_handoverLock);
    _connectionCount -= _handedOver.size();
    _handedOver.clear();
    _finished = true;
    _finishedCondition.notify_all();
}

STWUpcallListener::PacketResult
STWUpcallListener::_serveOnePacket(const std::shared_ptr<STWPeerConnection>& connection, uint32_t& sequence) {
    int fd = connection->fd();
    // One read takes the packet and tells its true size: a larger one is cut to the buffer.
    ssize_t size = recv(fd, _packetBuffer.data(), _packetBuffer.size(), MSG_TRUNC | MSG_DONTWAIT);
    if (size < 0 && (errno == EAGAIN || errno == EINTR))
        return PacketResult::NoneWaiting;
    if (size <= 0)
        return PacketResult::Close; // the peer closed (or failed)
    if (static_cast<size_t>(size) > STWUpcallMaxPacketSize) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: a packet of %zd bytes is larger than any upcall",
                      connection, size);
        return PacketResult::Close;
    }
    std::string_view packet(_packetBuffer.data(), static_cast<size_t>(size));
    std::string& reply = _replyBuffer;
    // A reply for a huge request is not kept around for the next one.
    struct Release {
        std::string& reply;
        ~Release() {
            if (reply.capacity() > kKeptReplyCapacity)
                std::string().swap(reply);
        }
    } release{reply};
    if (!STWKernServePacket(packet, connection->auditToken(), sequence++, &reply)) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: nothing answers its packet of %zd bytes",
                      connection, size);
        return PacketResult::Close;
    }
    if (send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) != static_cast<ssize_t>(reply.size())) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: its reply of %zu bytes cannot be sent: %s",
                      connection, reply.size(), strerror(errno));
        return PacketResult::Close;
    }
    return PacketResult::Served;
}
