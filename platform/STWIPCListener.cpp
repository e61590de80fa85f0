#include "platform/STWIPCListener.h"

#include "common/STWLog.h"
#include "platform/STWIPCFrame.h"

#include <cerrno>
#include <cstring>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

STWIPCListener::STWIPCListener(Options options, ConnectionHandler onConnection, MessageHandler onMessage)
    : _options(std::move(options)), _onConnection(std::move(onConnection)), _onMessage(std::move(onMessage)) {}

STWIPCListener::~STWIPCListener() { stop(); }

bool STWIPCListener::start(STWErrorRef* error) {
    if (_options.allowSocketActivation && sd_listen_fds(0) >= 1 &&
        sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) > 0) {
        _listenFD = SD_LISTEN_FDS_START;
        _socketActivated = true;
        STW_LOG_NOTICE(STWLogCategory::Tolvan, "Serving the socket passed by the service manager");
    } else {
        const std::filesystem::path& path = _options.socketPath;
        sockaddr_un address{};
        address.sun_family = AF_UNIX;
        if (path.native().size() >= sizeof address.sun_path) {
            STWSetError(error, STW_POSIX_ERROR(ENAMETOOLONG, "Socket path %@ is too long", path));
            return false;
        }
        memcpy(address.sun_path, path.c_str(), path.native().size() + 1);
        std::error_code ec;
        std::filesystem::create_directories(path.parent_path(), ec);
        int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
        if (fd < 0) {
            STWSetError(error, STW_POSIX_ERROR(errno, "socket() failed"));
            return false;
        }
        // A socket file left by an earlier run is stale: only one daemon serves a root.
        unlink(path.c_str());
        if (bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            chmod(path.c_str(), 0666) != 0 || listen(fd, SOMAXCONN) != 0) {
            int saved = errno;
            close(fd);
            STWSetError(error, STW_POSIX_ERROR(saved, "Cannot listen on %@", path));
            return false;
        }
        _listenFD = fd;
        STW_LOG_NOTICE(STWLogCategory::Tolvan, "Listening on %@", path);
    }
    _acceptThread = std::thread([this] { _acceptLoop(); });
    return true;
}

void STWIPCListener::stop() {
    if (_stopping.exchange(true))
        return;
    if (_acceptThread.joinable())
        _acceptThread.join();
    if (_listenFD >= 0 && !_socketActivated)
        unlink(_options.socketPath.c_str());
    if (_listenFD >= 0)
        close(_listenFD);
    _listenFD = -1;
    std::set<std::shared_ptr<STWPeerConnection>> connections;
    {
        std::lock_guard guard(_lock);
        connections = _lock_connections;
    }
    for (const auto& peer : connections)
        peer->cancel();
    // The connection threads refer to this listener: give those still finishing a request
    // time to end before it goes away.
    std::unique_lock guard(_lock);
    _connectionsGone.wait_for(guard, std::chrono::seconds(10), [&] { return _lock_connections.empty(); });
}

size_t STWIPCListener::connectionCount() const {
    std::lock_guard guard(_lock);
    return _lock_connections.size();
}

std::chrono::steady_clock::time_point STWIPCListener::lastConnectionChange() const {
    std::lock_guard guard(_lock);
    return _lock_lastConnectionChange;
}

void STWIPCListener::_acceptLoop() {
    while (!_stopping.load()) {
        // Wake up now and then to notice stop().
        pollfd p{_listenFD, POLLIN, 0};
        int ready = poll(&p, 1, 200);
        if (ready <= 0)
            continue;
        int fd = accept4(_listenFD, nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno != EINTR && errno != EAGAIN && errno != ECONNABORTED)
                STW_LOG_ERROR(STWLogCategory::Tolvan, "accept failed: %s", strerror(errno));
            if (errno == EMFILE || errno == ENFILE)
                usleep(100 * 1000);
            continue;
        }
        STWErrorRef error;
        auto peer = STWPeerConnection::adopt(fd, &error);
        if (!peer)
            continue;
        _connectionChanged(peer, true);
        std::thread([this, peer] { _serve(peer); }).detach();
    }
}

void STWIPCListener::_connectionChanged(const std::shared_ptr<STWPeerConnection>& peer, bool added) {
    std::lock_guard guard(_lock);
    if (added)
        _lock_connections.insert(peer);
    else
        _lock_connections.erase(peer);
    _lock_lastConnectionChange = std::chrono::steady_clock::now();
    if (_lock_connections.empty())
        _connectionsGone.notify_all();
}

void STWIPCListener::_serve(std::shared_ptr<STWPeerConnection> peer) {
    _onConnection(peer);
    STWFrameReader reader(peer->fd());
    bool sawRequest = false;
    while (!peer->isCancelled()) {
        STWFrame frame;
        std::string reason;
        STWFrameReadResult result = reader.read(frame, &reason);
        if (result == STWFrameReadResult::EndOfStream)
            break;
        if (result == STWFrameReadResult::Error) {
            if (!peer->isCancelled())
                STW_LOG_ERROR(STWLogCategory::Tolvan, "Closing %@: %@", peer, reason);
            break;
        }
        if (frame.kind == STWFrameKindHello) {
            if (!_handleHello(peer, frame.id, frame.body, sawRequest))
                break;
            continue;
        }
        if (frame.kind != STWFrameKindRequest) {
            // A request needs a reply context; anything else is not ours to answer.
            STW_LOG_ERROR(STWLogCategory::Tolvan, "Closing %@: unexpected frame kind %llu", peer, frame.kind);
            break;
        }
        sawRequest = true;
        _onMessage(peer, frame.id, std::move(frame.body));
    }
    peer->cancel();
    _connectionChanged(peer, false);
}

bool STWIPCListener::_handleHello(const std::shared_ptr<STWPeerConnection>& peer, uint64_t id,
                                  const STWValue::Dictionary& body, bool afterRequest) {
    std::string reason;
    std::optional<STWClientRegistryEntry> identity;
    if (!_options.developerMode)
        reason = "developer mode is off";
    else if (afterRequest || peer->declaredIdentity())
        reason = "a hello must be the first frame";
    else if (!(identity = STWClientRegistryEntry::fromDictionary(body, false, &reason)))
        reason = "malformed hello: " + reason;
    if (!identity) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Refusing hello from %@: %@", peer, reason);
        peer->sendFrame(STWFrameKindReply, id, {{"ReplyError", STWValue(uint64_t{STWErrorNotEntitled})}});
        return false;
    }
    STW_LOG_NOTICE(STWLogCategory::Tolvan, "%@ declares itself %@", peer, identity->codeSigningIdentifier);
    peer->setDeclaredIdentity(std::make_shared<const STWClientRegistryEntry>(std::move(*identity)));
    return peer->sendFrame(STWFrameKindReply, id, {{"ReplyError", STWValue(uint64_t{STWErrorSuccess})}});
}
