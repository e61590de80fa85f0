// One client connection of the request socket: the peer's credentials, taken when it
// connected and pinned by a pidfd, its audit token, its security label, the identity it
// declared in developer mode, and the thread-safe sending of frames. Replies of one
// connection may be sent from several threads (commands that answer from a completion),
// so sends are serialised here.
#pragma once

#include "common/STWError.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"
#include "platform/STWAuditToken.h"
#include "platform/STWClientRegistry.h"

#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <sys/types.h>

class STWPeerConnection {
public:
    // Takes ownership of a connected Unix stream socket and reads who is on the other end.
    // nullptr (the socket closed) when the peer's credentials cannot be read.
    static std::shared_ptr<STWPeerConnection> adopt(int fd, STWErrorRef* error);
    ~STWPeerConnection();
    STWPeerConnection(const STWPeerConnection&) = delete;
    STWPeerConnection& operator=(const STWPeerConnection&) = delete;

    int fd() const { return _fd; }
    uint64_t serial() const { return _serial; }
    pid_t pid() const { return _pid; }
    uid_t uid() const { return _uid; }
    gid_t gid() const { return _gid; }
    const STWAuditToken& auditToken() const { return _auditToken; }
    // The LSM label of the peer (SO_PEERSEC), when the kernel has one.
    const std::optional<std::string>& securityLabel() const { return _securityLabel; }
    // The peer's own label marks it as confined (anything but "unconfined").
    bool isConfinedByLabel() const;
    // False once the process that connected has exited (its pid may since be reused).
    bool isAlive() const;

    // The identity a developer-mode hello declared; nullptr otherwise.
    const STWClientRegistryEntryRef& declaredIdentity() const { return _declaredIdentity; }
    void setDeclaredIdentity(STWClientRegistryEntryRef identity) { _declaredIdentity = std::move(identity); }

    // What the daemon derives once per connection from who is on the other end (the
    // caller's client identity): the credentials and the pidfd never change, so the
    // first request builds it and the others reuse it.
    std::shared_ptr<const void> context() const;
    void setContext(std::shared_ptr<const void> context);

    // Sends one frame; false when the peer is gone.
    bool sendFrame(uint64_t kind, uint64_t id, const STWValue::Dictionary& body);
    // Shuts the socket down: the reading side sees the end of the stream and no more
    // replies go out.
    void cancel();
    bool isCancelled() const { return _cancelled.load(); }

    std::string description() const;

private:
    STWPeerConnection() = default;

    int _fd = -1;
    int _pidfd = -1;
    uint64_t _serial = 0;
    pid_t _pid = 0;
    uid_t _uid = 0;
    gid_t _gid = 0;
    STWAuditToken _auditToken;
    std::optional<std::string> _securityLabel;
    STWClientRegistryEntryRef _declaredIdentity;
    STWMutex _sendLock; // one frame at a time on the socket
    mutable STWMutex _contextLock;
    std::shared_ptr<const void> _context STW_GUARDED_BY(_contextLock);
    std::atomic<bool> _cancelled{false};
};
