// Maps personas and bundle identifiers to user identities.
//
// Filled lazily from the persona service and returned to "invalid" whenever the service
// reports that the persona list changed; the next accessor rebuilds it. Every container
// identity, client identity and metadata read asks this cache which user identity a
// request or a stored file means. The process-wide instance is STWUserIdentitySharedCache.
#pragma once

#include "common/STWThreadSafety.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "platform/STWPersonaService.h"
#include "platform/STWQueue.h"

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

using STWUserIdentitySet = std::unordered_set<STWUserIdentityRef, STWUserIdentityRefHash, STWUserIdentityRefEqual>;

class STWUserIdentityCache : public std::enable_shared_from_this<STWUserIdentityCache> {
public:
    // Creates a cache and registers it for persona-list updates.
    static std::shared_ptr<STWUserIdentityCache> create();
    virtual ~STWUserIdentityCache();

    static STWUserIdentityRef defaultUserIdentity();
    static bool personasAreSupported();

    STWUserIdentityRef userIdentityForLegacyMobileUser();
    STWUserIdentityRef userIdentityForPersonalPersona();
    STWUserIdentityRef userIdentityForPersonalPersonaWithUID(uid_t uid, gid_t gid);
    STWUserIdentityRef unspecificUserIdentity();
    STWUserIdentityRef userIdentityForCurrentUserWithPersonaUniqueString(const std::optional<std::string>& unique);
    STWUserIdentityRef userIdentityForPersonaUniqueString(const std::optional<std::string>& unique, uid_t uid,
                                                          gid_t gid);
    STWUserIdentityRef userIdentityWithPersonaID(uint32_t personaID);
    STWUserIdentitySet userIdentitiesForBundleIdentifier(const std::string& bundleIdentifier);
    bool isBundleIdentifier(const std::string& bundleIdentifier, const STWUserIdentityRef& associatedWithUserIdentity);
    STWUserIdentityRef userIdentityForCurrentContext();
    STWUserIdentityRef userIdentityForCurrentContextWithUID(uid_t uid, gid_t gid);
    void forEachAccessibleUserIdentitySynchronouslyExecuteBlock(const std::function<void(const STWUserIdentityRef&)>& block);

    void flush();
    void flushAndRepopulateWithUserIdentities(const std::vector<STWUserIdentityRef>& identities);
    void personaListDidUpdate();
    // Ends the registration for persona-list updates; also run at destruction.
    void unregister();
    bool isRegistered() const;
    bool cacheInvalid();
    void setCacheInvalid(bool invalid);

    static STWUserIdentityRef userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes);
    static STWUserIdentityRef userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes, bool forceUnspecific);
    static STWUserIdentityRef userIdentityWithPersonaAttributes(const STWPersonaRecord* attributes, uid_t uid, gid_t gid,
                                                                bool forceUnspecific);

    // Pause between attempts to fetch the persona list (one second; tests shorten it).
    static void setResyncRetryInterval(std::chrono::milliseconds interval);

    std::string description() const;

protected:
    STWUserIdentityCache();
    // Registers with the persona service; the cache must already be owned by a shared_ptr,
    // since the service holds it weakly.
    void _registerForPersonaListUpdates();
    virtual const char* _className() const { return "STWUserIdentityCache"; }

private:
    void _lock_flush() STW_REQUIRES(_lock);
    void _lock_resync() STW_REQUIRES(_lock);
    bool _lock_resync_fromUserPersonaAttributes(const std::vector<STWPersonaRecord>& personas) STW_REQUIRES(_lock);
    // Rebuilds the cache when it is invalid.
    void _lock_makeValid() STW_REQUIRES(_lock);
    // The base user id rule: role users stand for the mobile user.
    static void _applyBaseUserIDRule(uid_t& uid, gid_t& gid);
    STWUserIdentityRef _lock_identityWithIDs(const STWUserIdentityRef& identity, uid_t uid, gid_t gid)
        STW_REQUIRES(_lock);

    // Taken after the container cache's lock, never before it (see architecture.md).
    STWMutex _lock;
    std::shared_ptr<STWQueue> _flushQueue;
    std::atomic<bool> _registered{false};
    // The service this cache registered with and the registration's token (-1: none).
    std::shared_ptr<STWPersonaService> _personaService;
    std::atomic<int> _registrationToken{-1};
    bool _cacheInvalid STW_GUARDED_BY(_lock) = true;
    std::unordered_map<std::string, STWUserIdentitySet> _lock_bundleToEnterpriseIdentitiesMap STW_GUARDED_BY(_lock);
    std::unordered_map<std::string, STWUserIdentityRef> _lock_personaUniqueStringToUserIdentityMap
        STW_GUARDED_BY(_lock);
    std::unordered_map<uint32_t, STWUserIdentityRef> _lock_personaIDToUserIdentityMap STW_GUARDED_BY(_lock);
    STWUserIdentityRef _lock_userIdentityForPersonalPersona STW_GUARDED_BY(_lock);
    STWUserIdentityRef _lock_userIdentityForUnspecificPersona STW_GUARDED_BY(_lock);
};
