#include "platform/STWIPCListener.h"

#include "common/STWLog.h"
#include "common/STWIPCFrame.h"

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <optional>
#include <string_view>
#include <sys/eventfd.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>
#include <utility>

namespace {

// Lets one line a second through for an event that a flood of clients could repeat, and
// counts the ones held back so that the next line can say how many there were.
class LogThrottle {
public:
    // True when this one may be logged; `held` is then how many were not since the last.
    bool admit(uint64_t* held) {
        STWLockGuard guard(_lock);
        auto now = std::chrono::steady_clock::now();
        if (_lastLine && now - *_lastLine < std::chrono::seconds(1)) {
            ++_held;
            return false;
        }
        _lastLine = now;
        *held = std::exchange(_held, 0);
        return true;
    }

private:
    STWMutex _lock;
    std::optional<std::chrono::steady_clock::time_point> _lastLine STW_GUARDED_BY(_lock);
    uint64_t _held STW_GUARDED_BY(_lock) = 0;
};

LogThrottle refusalLog;
LogThrottle closingLog;

std::string heldBack(uint64_t held, const char* what) {
    return held ? STWFormat(" (%llu more %s since the last report)", held, what) : std::string();
}

} // namespace

STWIPCListener::STWIPCListener(Options options, ConnectionHandler onConnection, MessageHandler onMessage)
    : _options(std::move(options)), _onConnection(std::move(onConnection)), _onMessage(std::move(onMessage)),
      _frameBudget(_options.bounds.maxPendingFrameBytes) {
    _resolveConnectionCaps();
}

// Each connection holds two descriptors (its socket and a pidfd of the peer) and a
// thread; a quarter of the descriptors (at least 64) stays with the daemon's databases,
// logs, watches and file walks, and a thousand threads is far beyond what the device's
// clients need at once. One user gets a quarter of the connections, so that clients of
// other users are still served while one floods.
void STWIPCListener::_resolveConnectionCaps() {
    rlimit descriptors{};
    rlim_t limit = getrlimit(RLIMIT_NOFILE, &descriptors) == 0 ? descriptors.rlim_cur : 1024;
    rlim_t reserved = std::max<rlim_t>(64, limit / 4);
    rlim_t affordable = std::clamp<rlim_t>(limit > reserved ? (limit - reserved) / 2 : 1, 1, 1024);
    _maxConnections = _options.bounds.maxConnections.value_or(static_cast<size_t>(affordable));
    _maxConnectionsPerUser =
        std::min(_maxConnections,
                 _options.bounds.maxConnectionsPerUser.value_or(std::max<size_t>(1, _maxConnections / 4)));
    if (_maxConnections > affordable)
        STW_LOG_ERROR(
            STWLogCategory::Tolvan,
            "MaxConnections %zu needs more descriptors than the limit of %llu leaves: accepting may fail",
            _maxConnections, static_cast<unsigned long long>(limit));
}

STWIPCListener::~STWIPCListener() {
    // The threads use this object: wait for them however long it takes.
    while (!stop()) {
    }
}

// The request socket among those the service manager passed: the one named
// "stowlyd.sock" (FileDescriptorName= in stowlyd.socket; a unit without it names its
// sockets after itself, "stowlyd.socket"), else the only one without a name. The others
// (the upcall socket) are left for their own servers. -1 when there is none.
int STWIPCListener::_socketFromServiceManager() {
    char** names = nullptr;
    int count = sd_listen_fds_with_names(0, &names);
    int named = -1, unnamed = -1, unnamedCount = 0;
    for (int i = 0; i < count; i++) {
        std::string_view name = names && names[i] ? names[i] : "";
        if (name == "stowlyd.sock" || name == "stowlyd.socket")
            named = SD_LISTEN_FDS_START + i;
        else if (name.empty() || name == "unknown") { // "unknown": passed without names
            unnamed = SD_LISTEN_FDS_START + i;
            unnamedCount++;
        }
    }
    for (int i = 0; names && i < count; i++)
        free(names[i]);
    free(names);
    int fd = named >= 0 ? named : unnamedCount == 1 ? unnamed : -1;
    if (count > 0 && fd < 0)
        STW_LOG_ERROR(STWLogCategory::Tolvan,
                      "None of the %d sockets passed by the service manager is the request socket", count);
    if (fd >= 0 && sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0) {
        STW_LOG_ERROR(
            STWLogCategory::Tolvan,
            "The request socket passed by the service manager is not a listening Unix stream socket");
        fd = -1;
    }
    return fd;
}

bool STWIPCListener::start(STWEventLoop& loop, STWErrorRef* error) {
    if (int fd = _options.allowSocketActivation ? _socketFromServiceManager() : -1; fd >= 0) {
        // Accepting must never block the loop.
        if (fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK) != 0) {
            STWSetError(error, STW_POSIX_ERROR(errno, "Cannot make the passed socket non-blocking"));
            return false;
        }
        _listenFD.reset(fd);
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
        STWFileDescriptor socketFD(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
        if (!socketFD) {
            STWSetError(error, STW_POSIX_ERROR(errno, "socket() failed"));
            return false;
        }
        // A socket file left by an earlier run is stale: only one daemon serves a root.
        unlink(path.c_str());
        if (bind(socketFD.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            chmod(path.c_str(), 0666) != 0 || listen(socketFD.get(), SOMAXCONN) != 0) {
            STWSetError(error, STW_POSIX_ERROR(errno, "Cannot listen on %@", path));
            return false;
        }
        _listenFD = std::move(socketFD);
        STW_LOG_NOTICE(STWLogCategory::Tolvan, "Listening on %@", path);
    }
    _endedFD.reset(eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (_endedFD) {
        _acceptSource = loop.watchReadable(_listenFD.get(), [this] { _acceptPending(); });
        _acceptRetry = loop.timer([this] { _acceptSource.setEnabled(true); });
        _endedSource = loop.watchReadable(_endedFD.get(), [this] { _connectionsEnded(); });
    }
    if (!_acceptSource || !_acceptRetry || !_endedSource) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot accept on the event loop"));
        return false;
    }
    const STWClientBounds& bounds = _options.bounds;
    STW_LOG_NOTICE(
        STWLogCategory::Tolvan,
        "Serving up to %zu connections, %zu per user; a first frame within %g s, every frame within "
        "%g s; %zu bytes for unfinished frames",
        _maxConnections, _maxConnectionsPerUser, bounds.firstFrameTimeout.count() / 1000.0,
        bounds.frameTimeout.count() / 1000.0, bounds.maxPendingFrameBytes);
    return true;
}

bool STWIPCListener::stop(std::chrono::steady_clock::duration timeout) {
    auto deadline = std::chrono::steady_clock::now() + timeout;
    if (!_stopping.exchange(true)) {
        _acceptSource.reset();
        _acceptRetry.reset();
        if (_listenFD && !_socketActivated)
            unlink(_options.socketPath.c_str());
        _listenFD.reset();
    }
    std::vector<std::shared_ptr<STWPeerConnection>> open;
    {
        STWLockGuard guard(_lock);
        for (const auto& [serial, connection] : _lock_connections)
            if (!connection.finished)
                open.push_back(connection.peer);
    }
    // Their readers see the end of the stream; a request being handled runs to its end,
    // but its reply is not sent.
    for (const auto& peer : open)
        peer->cancel();
    bool ended;
    {
        STWUniqueLock guard(_lock);
        ended = _connectionsGone.wait_until(guard.native(), deadline, [&] {
            _lock.assertHeld();
            return _lock_openConnections == 0;
        });
        if (!ended)
            for (const auto& [serial, connection] : _lock_connections)
                if (!connection.finished)
                    STW_LOG_ERROR(STWLogCategory::Tolvan,
                                  "%@ is still being served after the listener stopped", connection.peer);
    }
    _reapFinishedConnections();
    return ended;
}

size_t STWIPCListener::connectionCount() const {
    STWLockGuard guard(_lock);
    return _lock_openConnections;
}

std::chrono::steady_clock::time_point STWIPCListener::lastConnectionChange() const {
    STWLockGuard guard(_lock);
    return _lock_lastConnectionChange;
}

void STWIPCListener::_acceptPending() {
    // A few at a time, so that the loop's other sources are served during a flood; the
    // socket stays readable for the rest.
    for (int i = 0; i < 16; i++) {
        int fd = accept4(_listenFD.get(), nullptr, nullptr, SOCK_CLOEXEC);
        if (fd < 0) {
            if (errno == EINTR || errno == ECONNABORTED)
                continue;
            if (errno == EAGAIN)
                return;
            // Out of descriptors, say: the socket stays readable, so rather than spin, wait
            // a moment for some to come free.
            STW_LOG_ERROR(STWLogCategory::Tolvan, "accept failed: %s", strerror(errno));
            _acceptSource.setEnabled(false);
            _acceptRetry.armAt(std::chrono::steady_clock::now() + std::chrono::milliseconds(100));
            return;
        }
        if (!_admit(fd)) {
            close(fd);
            continue;
        }
        STWErrorRef error;
        if (auto peer = STWPeerConnection::adopt(fd, &error))
            _startConnection(std::move(peer));
    }
}

void STWIPCListener::_connectionsEnded() {
    uint64_t count;
    while (read(_endedFD.get(), &count, sizeof count) < 0 && errno == EINTR) {
    }
    _reapFinishedConnections();
    if (_options.connectionsClosed)
        _options.connectionsClosed();
}

// Over a cap, a connection is closed before anything else is done for it: reading the
// peer's credentials is all it costs.
//
// Root is held to the global cap only. Its peers are the system's own services, some of
// which keep several connections open, and a root process that wanted the daemon gone
// could simply kill it: a per-user cap would protect nothing and might starve them. The
// global cap still holds, so descriptors never run out.
bool STWIPCListener::_admit(int fd) {
    struct ucred credentials {};
    socklen_t length = sizeof credentials;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0)
        return false;
    std::string refusal;
    {
        STWLockGuard guard(_lock);
        auto user = _lock_openConnectionsPerUser.find(credentials.uid);
        size_t ofUser = user == _lock_openConnectionsPerUser.end() ? 0 : user->second;
        if (_lock_openConnections >= _maxConnections)
            refusal = STWFormat("all %zu connections are in use", _maxConnections);
        else if (credentials.uid != 0 && ofUser >= _maxConnectionsPerUser)
            refusal = STWFormat("its user has all of its %zu connections open", _maxConnectionsPerUser);
    }
    if (refusal.empty())
        return true;
    uint64_t held = 0;
    if (refusalLog.admit(&held))
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Refusing a connection from pid %d, uid %u: %@%@",
                      credentials.pid, credentials.uid, refusal, heldBack(held, "refused"));
    return false;
}

void STWIPCListener::_startConnection(std::shared_ptr<STWPeerConnection> peer) {
    STWLockGuard guard(_lock);
    Connection& connection = _lock_connections[peer->serial()];
    connection.peer = peer;
    ++_lock_openConnections;
    ++_lock_openConnectionsPerUser[peer->uid()];
    _lock_lastConnectionChange = std::chrono::steady_clock::now();
    try {
        // Started under the lock, so the thread cannot end before its entry holds it.
        connection.thread = std::thread([this, peer] { _serve(peer); });
    } catch (const std::system_error& e) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Closing %@: cannot start its thread: %s", peer, e.what());
        peer->cancel();
        _lock_connectionEnded(connection);
    }
}

void STWIPCListener::_lock_connectionEnded(Connection& connection) {
    connection.finished = true;
    auto user = _lock_openConnectionsPerUser.find(connection.peer->uid());
    if (--user->second == 0)
        _lock_openConnectionsPerUser.erase(user);
    --_lock_openConnections;
    // The socket closes once the thread (and any completion still holding the peer) lets go.
    connection.peer.reset();
    _lock_lastConnectionChange = std::chrono::steady_clock::now();
    if (_lock_openConnections == 0)
        _connectionsGone.notify_all();
    uint64_t one = 1;
    if (write(_endedFD.get(), &one, sizeof one) != sizeof one)
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Cannot report a closed connection to the event loop: %s",
                      strerror(errno));
}

void STWIPCListener::_reapFinishedConnections() {
    std::vector<std::thread> finished;
    {
        STWLockGuard guard(_lock);
        for (auto it = _lock_connections.begin(); it != _lock_connections.end();) {
            if (it->second.finished) {
                finished.push_back(std::move(it->second.thread));
                it = _lock_connections.erase(it);
            } else {
                ++it;
            }
        }
    }
    for (std::thread& thread : finished)
        if (thread.joinable())
            thread.join();
}

void STWIPCListener::_serve(std::shared_ptr<STWPeerConnection> peer) {
    _onConnection(peer);
    {
        STWFrameReader reader(peer->fd(), {.firstFrameTimeout = _options.bounds.firstFrameTimeout,
                                           .frameTimeout = _options.bounds.frameTimeout,
                                           .budget = &_frameBudget,
                                           .maxObjects = STWIPCRequestMaxObjects});
        bool sawRequest = false;
        std::string reason;
        while (!peer->isCancelled()) {
            STWFrame frame;
            STWFrameReadResult result = reader.read(frame, &reason);
            if (result != STWFrameReadResult::Frame)
                break;
            if (frame.kind == STWFrameKindHello) {
                if (!_handleHello(peer, frame.id, frame.body, sawRequest))
                    break;
                continue;
            }
            if (frame.kind != STWFrameKindRequest) {
                // A request needs a reply context; anything else is not ours to answer.
                reason = STWFormat("unexpected frame kind %llu", frame.kind);
                break;
            }
            sawRequest = true;
            _onMessage(peer, frame.id, std::move(frame.body));
        }
        uint64_t held = 0;
        if (!reason.empty() && !peer->isCancelled() && closingLog.admit(&held))
            STW_LOG_ERROR(STWLogCategory::Tolvan, "Closing %@: %@%@", peer, reason,
                          heldBack(held, "closed for bad input"));
    }
    peer->cancel();
    STWLockGuard guard(_lock);
    _lock_connectionEnded(_lock_connections.at(peer->serial()));
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
