// Group containers are wanted while at least one stored code-signing entry names their
// group in its entitlements. The mapping releases a group the moment its last reference
// goes; the group manager answers which groups an owner is entitled to and sweeps a whole
// group class for containers that no entry references any more. It never deletes
// anything itself: it queues stage-for-delete commands on the caller's command queue.
//
// One process-wide instance (defaultManager()). The sweep is called with the daemon-wide
// identifier lock held; it reads the counts on the mapping's queue and lists containers
// off it.
#pragma once

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWUserIdentityCache.h"

#include <memory>
#include <optional>
#include <string>

class STWCommandQueue;

class STWGroupManager {
public:
    static const std::shared_ptr<STWGroupManager>& defaultManager();
    explicit STWGroupManager(std::shared_ptr<STWUserIdentityCache> userIdentityCache);

    // Queues the deletion of every container of the type's class that no stored entry
    // references: system groups for the default user identity, application groups for
    // every accessible user whose user base directory exists.
    void reconcileGroupContainersOfType(STWGroupType type, STWCommandQueue& commandQueue);
    void _cleanupUnreferencedGroupContainersForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                            STWContainerClass containerClass,
                                                            const STWReferenceCountSet& referenceCounts,
                                                            STWCommandQueue& commandQueue);
    // The groups `owner` is entitled to: system groups for class 13, application groups
    // otherwise; an empty list when it has none. nullopt with 11 for no owner, 40 on an
    // exception. With `useLocking` the daemon-wide write lock is held meanwhile.
    std::optional<STWGroupIdentifierList>
    groupContainerIdentifiersForOwnerIdentifier(const std::optional<std::string>& ownerIdentifier,
                                                STWContainerClass groupContainerClass, bool useLocking,
                                                uint64_t* error);

    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }

private:
    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
};
