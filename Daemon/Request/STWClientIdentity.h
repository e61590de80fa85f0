// Who sent a request: the caller's code-signing identifier (its bundle identifier),
// POSIX credentials, the user identity (persona) it acts for, its entitlements, whether
// the sandbox confines it, and its audit token. Made per message by the dispatcher from
// the peer connection; the daemon's own work uses a privileged identity that belongs to
// no process. Immutable and shared.
#pragma once

#include "Daemon/Model/STWUserIdentity.h"
#include "common/STWError.h"
#include "common/STWValue.h"
#include "platform/STWAuditToken.h"

#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>

class STWPeerConnection;
class STWClientIdentity;
using STWClientIdentityRef = std::shared_ptr<const STWClientIdentity>;

inline constexpr const char* STWInstallerBundleIdentifier = "com.vorlane.setwrightd";
inline constexpr const char* STWPrivilegedBundleIdentifier = "com.vorlane.stowlyd.internal";

class STWClientIdentity {
public:
    static STWClientIdentityRef initWithBundleIdentifier(std::string bundleIdentifier, uid_t uid, gid_t gid,
                                                         pid_t pid, STWUserIdentityRef userIdentity,
                                                         std::optional<STWValue::Dictionary> entitlements,
                                                         bool sandboxed, const STWAuditToken& auditToken);

    static STWClientIdentityRef anonymousPrivilegedClientIdentity();
    static STWClientIdentityRef privilegedClientIdentityWithUserIdentity(STWUserIdentityRef userIdentity);
    // The identity of the process on the other end of `peer`, or nullptr when it has no
    // signing identifier or no user identity can be made for it.
    static STWClientIdentityRef clientIdentityWithTolvanConnection(const STWPeerConnection& peer);

    // True only for an entitlement whose value is a boolean true or a non-zero number.
    bool boolValueOfEntitlement(std::string_view key) const;
    // The entitlement's value, or nullptr.
    const STWValue* entitlementValue(std::string_view key) const;

    uid_t posixUIDForContainerClass(STWContainerClass containerClass) const {
        return _userIdentity->posixUIDForContainerClass(containerClass);
    }
    gid_t posixGIDForContainerClass(STWContainerClass containerClass) const {
        return _userIdentity->posixGIDForContainerClass(containerClass);
    }

    bool isSandboxed() const { return _sandboxed; }
    pid_t posixPID() const { return _posixPID; }
    uid_t posixUID() const { return _posixUID; }
    gid_t posixGID() const { return _posixGID; }
    const std::string& bundleIdentifier() const { return _bundleIdentifier; }
    const std::optional<STWValue::Dictionary>& entitlements() const { return _entitlements; }
    const STWUserIdentityRef& userIdentity() const { return _userIdentity; }
    const STWAuditToken& auditToken() const { return _auditToken; }

    std::string description() const;

    // Forgets the cached installer identity (tests start from an empty slot).
    static void resetInstallerCacheForTesting();

    STWClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid, STWUserIdentityRef userIdentity,
                      std::optional<STWValue::Dictionary> entitlements, bool sandboxed, const STWAuditToken& auditToken);

private:
    bool _sandboxed;
    pid_t _posixPID;
    uid_t _posixUID;
    gid_t _posixGID;
    std::string _bundleIdentifier;
    std::optional<STWValue::Dictionary> _entitlements;
    STWUserIdentityRef _userIdentity;
    STWAuditToken _auditToken;
};
