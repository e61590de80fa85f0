#include "Daemon/Request/STWClientIdentity.h"
#include "common/STWThreadSafety.h"

#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWLog.h"
#include "platform/STWClientRegistry.h"
#include "platform/STWPeerConnection.h"
#include "platform/STWPersonaService.h"

#include <mutex>

namespace {

// The installer sends long bursts of requests; its identity is kept while its audit
// token stays the same, which spares the entitlement copy and the sandbox check.
STWMutex installerCacheLock;
STWClientIdentityRef installerCache STW_GUARDED_BY(installerCacheLock);

} // namespace

STWClientIdentity::STWClientIdentity(std::string bundleIdentifier, uid_t uid, gid_t gid, pid_t pid,
                                     STWUserIdentityRef userIdentity, std::optional<STWValue::Dictionary> entitlements,
                                     bool sandboxed, const STWAuditToken& auditToken)
    : _sandboxed(sandboxed), _posixPID(pid), _posixUID(uid), _posixGID(gid),
      _bundleIdentifier(std::move(bundleIdentifier)), _entitlements(std::move(entitlements)),
      _userIdentity(std::move(userIdentity)), _auditToken(auditToken) {}

STWClientIdentityRef STWClientIdentity::initWithBundleIdentifier(std::string bundleIdentifier, uid_t uid, gid_t gid,
                                                                 pid_t pid, STWUserIdentityRef userIdentity,
                                                                 std::optional<STWValue::Dictionary> entitlements,
                                                                 bool sandboxed, const STWAuditToken& auditToken) {
    return std::make_shared<const STWClientIdentity>(std::move(bundleIdentifier), uid, gid, pid,
                                                     std::move(userIdentity), std::move(entitlements), sandboxed,
                                                     auditToken);
}

STWClientIdentityRef STWClientIdentity::anonymousPrivilegedClientIdentity() {
    return privilegedClientIdentityWithUserIdentity(STWUserIdentityCache::defaultUserIdentity());
}

STWClientIdentityRef STWClientIdentity::privilegedClientIdentityWithUserIdentity(STWUserIdentityRef userIdentity) {
    return initWithBundleIdentifier(STWPrivilegedBundleIdentifier, 0, 0, 0, std::move(userIdentity), std::nullopt,
                                    false, STWAuditToken{});
}

bool STWClientIdentity::boolValueOfEntitlement(std::string_view key) const {
    const STWValue* value = entitlementValue(key);
    if (!value)
        return false;
    if (auto b = value->boolValue())
        return *b;
    if (value->isNumber())
        return value->realValue().value_or(0) != 0;
    return false;
}

const STWValue* STWClientIdentity::entitlementValue(std::string_view key) const {
    return _entitlements ? STWDictionaryFind(*_entitlements, key) : nullptr;
}

STWClientIdentityRef STWClientIdentity::clientIdentityWithTolvanConnection(const STWPeerConnection& peer) {
    static constexpr const char* function = "+[STWClientIdentity(Tolvan) clientIdentityWithTolvanConnection:]";
    pid_t pid = peer.pid();

    // Which program the peer runs decides its signing identifier, entitlements, sandbox
    // flag and the persona it acts for.
    STWErrorRef signingError;
    STWClientRegistryEntryRef entry = STWClientRegistry::sharedInstance().entryForPeer(peer, &signingError);

    STWUserIdentityRef userIdentity;
    {
        STWPersonaContext context(entry ? entry->personaUniqueString : std::nullopt);
        userIdentity =
            STWUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentContextWithUID(peer.uid(), peer.gid());
    }
    const STWAuditToken& token = peer.auditToken();
    std::optional<std::string> bundleIdentifier;
    if (entry)
        bundleIdentifier = entry->codeSigningIdentifier;
    bool installer = bundleIdentifier && *bundleIdentifier == STWInstallerBundleIdentifier;

    STWClientIdentityRef result;
    bool fromCache = false;
    if (installer) {
        STWLockGuard guard(installerCacheLock);
        if (installerCache && installerCache->auditToken() == token) {
            result = installerCache;
            fromCache = true;
        }
    }
    if (!fromCache) {
        STWValue::Dictionary entitlements;
        if (entry && entry->entitlements.isDictionary()) {
            entitlements = *entry->entitlements.dictionary();
        } else {
            STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan,
                       "Missing or malformed entitlements for pid %d", pid);
        }
        bool sandboxed = (entry && entry->sandboxed) || peer.isConfinedByLabel();
        if (!bundleIdentifier) {
            STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "Failed to copy signing ID for pid %d : %@",
                       pid, signingError);
        } else if (userIdentity) {
            result = initWithBundleIdentifier(*bundleIdentifier, peer.uid(), peer.gid(), pid, userIdentity,
                                              std::move(entitlements), sandboxed, token);
        }
        if (installer) {
            STWLockGuard guard(installerCacheLock);
            installerCache = result;
        }
    }
    STW_LOG_FN(function, STWLogLevel::Info, STWLogCategory::Tolvan, "[%s] Tolvan client identity: %@", function,
               result);
    return result;
}

void STWClientIdentity::resetInstallerCacheForTesting() {
    STWLockGuard guard(installerCacheLock);
    installerCache = nullptr;
}

std::string STWClientIdentity::description() const {
    return STWFormat("<%@: %p; bundleIdentifier = %@, userIdentity = %@, posixUID = %u, posixGID = %u, posixPID = %u, "
                     "isSandboxed = %d, entitlements = %@>",
                     "STWClientIdentity", static_cast<const void*>(this), _bundleIdentifier, _userIdentity, _posixUID,
                     _posixGID, static_cast<uint32_t>(_posixPID), _sandboxed ? 1 : 0,
                     _entitlements ? "YES" : "NO");
}
