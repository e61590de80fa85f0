#include "upcall/STWUpcallListener.h"

#include "common/STWLog.h"
#include "upcall/STWKernTransport.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <string_view>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

namespace {

// Room for the largest reply: a path or two for each group of a request buffer of the
// largest size. A packet beyond the send buffer cannot be sent at all.
constexpr int kReplySendBuffer = 16 << 20;

} // namespace

STWUpcallListener::STWUpcallListener(std::filesystem::path socketPath, std::shared_ptr<STWQueue> queue)
    : _socketPath(std::move(socketPath)), _queue(std::move(queue)) {}

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
    _loop = &loop;
    _acceptSource = loop.watchReadable(_listenFD.get(), [this] { _acceptPending(); });
    if (!_acceptSource) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot accept upcall connections on the event loop"));
        return false;
    }
    return true;
}

void STWUpcallListener::stop() {
    _acceptSource.reset();
    if (_listenFD && !_socketActivated)
        unlink(_socketPath.c_str());
    _listenFD.reset();
    // Queued upcalls keep their peers; their replies still go out.
    _connections.clear();
}

void STWUpcallListener::_acceptPending() {
    for (int i = 0; i < 16; i++) {
        int fd = accept4(_listenFD.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            if (errno != EAGAIN)
                STW_LOG_ERROR(STWLogCategory::Upcall, "accept failed: %s", strerror(errno));
            return;
        }
        if (_connections.size() >= STWUpcallMaxConnections) {
            STW_LOG_ERROR(STWLogCategory::Upcall, "Refusing an upcall connection: %zu are open",
                          _connections.size());
            close(fd);
            continue;
        }
        STWErrorRef error;
        auto peer = STWPeerConnection::adopt(fd, &error);
        if (!peer)
            continue;
        if (setsockopt(fd, SOL_SOCKET, SO_SNDBUFFORCE, &kReplySendBuffer, sizeof kReplySendBuffer) != 0)
            setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &kReplySendBuffer, sizeof kReplySendBuffer);
        auto connection = std::make_unique<Connection>();
        uint64_t serial = peer->serial();
        connection->peer = std::make_shared<Peer>(Peer{std::move(peer)});
        connection->readable = _loop->watchReadable(fd, [this, serial] { _packetsArrived(serial); }, true);
        if (!connection->readable) {
            STW_LOG_ERROR(STWLogCategory::Upcall, "Cannot watch %@: %s", connection->peer->connection,
                          strerror(errno));
            continue;
        }
        _connections.emplace(serial, std::move(connection));
    }
}

void STWUpcallListener::_packetsArrived(uint64_t serial) {
    auto it = _connections.find(serial);
    if (it == _connections.end())
        return;
    _queue->async([this, serial, peer = it->second->peer] {
        PacketResult result;
        while ((result = _serveOnePacket(*peer)) == PacketResult::Served) {
        }
        if (result == PacketResult::Close)
            _loop->post([this, serial] { _close(serial); });
    });
}

void STWUpcallListener::_close(uint64_t serial) { _connections.erase(serial); }

STWUpcallListener::PacketResult STWUpcallListener::_serveOnePacket(Peer& peer) {
    const STWPeerConnection& connection = *peer.connection;
    int fd = connection.fd();
    // The packet's true size, without taking it.
    ssize_t size = recv(fd, nullptr, 0, MSG_PEEK | MSG_TRUNC | MSG_DONTWAIT);
    if (size < 0 && (errno == EAGAIN || errno == EINTR))
        return PacketResult::NoneWaiting;
    if (size <= 0)
        return PacketResult::Close; // the peer closed (or failed)
    if (static_cast<size_t>(size) > STWUpcallMaxPacketSize) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: a packet of %zd bytes is larger than any upcall",
                      peer.connection, size);
        return PacketResult::Close;
    }
    std::string packet(static_cast<size_t>(size), '\0');
    if (recv(fd, packet.data(), packet.size(), MSG_DONTWAIT) != size)
        return PacketResult::Close;
    std::string reply;
    if (!STWKernServePacket(packet, connection.auditToken(), peer.sequence++, &reply)) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: nothing answers its packet of %zd bytes", peer.connection,
                      size);
        return PacketResult::Close;
    }
    if (send(fd, reply.data(), reply.size(), MSG_DONTWAIT | MSG_NOSIGNAL) != static_cast<ssize_t>(reply.size())) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Closing %@: its reply of %zu bytes cannot be sent: %s", peer.connection,
                      reply.size(), strerror(errno));
        return PacketResult::Close;
    }
    return PacketResult::Served;
}
