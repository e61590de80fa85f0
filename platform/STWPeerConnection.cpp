#include "platform/STWPeerConnection.h"

#include "common/STWFormat.h"
#include "common/STWIPCFrame.h"

#include <cerrno>
#include <csignal>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <unistd.h>

#ifndef SO_PEERPIDFD
#define SO_PEERPIDFD 77
#endif

namespace {

std::atomic<uint64_t> nextSerial{1};

int pidfdOfPeer(int fd, pid_t pid) {
    int pidfd = -1;
    socklen_t length = sizeof pidfd;
    // The kernel's own pidfd of the peer cannot race with pid reuse; older kernels only
    // have pidfd_open, which is as good as long as the peer is still connected.
    if (getsockopt(fd, SOL_SOCKET, SO_PEERPIDFD, &pidfd, &length) == 0 && pidfd >= 0)
        return pidfd;
    return static_cast<int>(syscall(SYS_pidfd_open, pid, 0));
}

} // namespace

std::shared_ptr<STWPeerConnection> STWPeerConnection::adopt(int fd, STWErrorRef* error) {
    std::shared_ptr<STWPeerConnection> peer(new STWPeerConnection);
    peer->_fd = fd;
    peer->_serial = nextSerial++;
    struct ucred credentials {};
    socklen_t length = sizeof credentials;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &credentials, &length) != 0) {
        STWSetError(error, STW_POSIX_ERROR(errno, "Cannot read the credentials of a peer"));
        return nullptr;
    }
    // A client that stops reading its replies must not hold a daemon thread (or the
    // completions that answer on its connection) for ever.
    timeval sendTimeout{30, 0};
    setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &sendTimeout, sizeof sendTimeout);
    peer->_pid = credentials.pid;
    peer->_uid = credentials.uid;
    peer->_gid = credentials.gid;
    peer->_pidfd = pidfdOfPeer(fd, credentials.pid);
    auto token = STWAuditToken::forProcess(credentials.pid, credentials.uid, credentials.gid);
    if (peer->_pidfd < 0 || !token || !peer->isAlive()) {
        STWSetError(error, STW_POSIX_ERROR(ESRCH, "Peer process %d is gone", credentials.pid));
        return nullptr;
    }
    peer->_auditToken = *token;

    char label[4096];
    socklen_t labelLength = sizeof label;
    if (getsockopt(fd, SOL_SOCKET, SO_PEERSEC, label, &labelLength) == 0 && labelLength > 0) {
        std::string text(label, labelLength);
        while (!text.empty() && (text.back() == '\0' || text.back() == '\n'))
            text.pop_back();
        if (!text.empty())
            peer->_securityLabel = text;
    }
    return peer;
}

STWPeerConnection::~STWPeerConnection() {
    if (_fd >= 0)
        close(_fd);
    if (_pidfd >= 0)
        close(_pidfd);
}

bool STWPeerConnection::isConfinedByLabel() const {
    // A process that no profile confines carries the label "unconfined".
    return _securityLabel && *_securityLabel != "unconfined";
}

bool STWPeerConnection::isAlive() const {
    return _pidfd >= 0 && syscall(SYS_pidfd_send_signal, _pidfd, 0, nullptr, 0) == 0;
}

bool STWPeerConnection::sendFrame(uint64_t kind, uint64_t id, const STWValue::Dictionary& body) {
    std::string frame = STWFrameEncode(kind, id, body);
    STWLockGuard guard(_sendLock);
    if (_cancelled.load())
        return false;
    return STWFrameWrite(_fd, frame);
}

void STWPeerConnection::cancel() {
    STWLockGuard guard(_sendLock);
    if (!_cancelled.exchange(true))
        shutdown(_fd, SHUT_RDWR);
}

std::string STWPeerConnection::description() const {
    return STWFormat("<connection %llu: pid %d, uid %u, gid %u>", _serial, _pid, _uid, _gid);
}

std::shared_ptr<const void> STWPeerConnection::context() const {
    STWLockGuard guard(_contextLock);
    return _context;
}

void STWPeerConnection::setContext(std::shared_ptr<const void> context) {
    STWLockGuard guard(_contextLock);
    _context = std::move(context);
}
