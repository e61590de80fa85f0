// Group containers of an owner: the lookup policy of a request that asks for them, and
// their creation under the daemon-wide lock (the operation of STWClientConnection that
// makes group containers).
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWGroupManager.h"
#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/STWLocks.h"
#include "common/STWLog.h"

std::optional<std::map<std::string, STWMetadataRef>>
STWClientConnection::groupContainersForOwnerIdentifier(const std::string& ownerIdentifier,
                                                       const STWUserIdentityRef& userIdentity,
                                                       STWContainerClass groupContainerClass, uint64_t* error) {
    std::optional<std::string> client = clientBundleIdentifier();
    bool allowed = (client && *client == ownerIdentifier) || allowOtherIdLookup() || unrestricted() ||
                   isEntitledForLookupWithClass(groupContainerClass, ownerIdentifier) ||
                   STWWhitelist::sharedWhitelist()->isLookupWhitelistedFromCodeSignIdentifier(
                       client.value_or(""), groupContainerClass, ownerIdentifier);
    if (!allowed) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "%@ not entitled to retrieve group container class %ld with identifier %@",
                      client ? STWFormatArg(*client) : STWFormatArg(nullptr), groupContainerClass, ownerIdentifier);
        *error = STWErrorNotEntitled;
        return std::nullopt;
    }
    setAllowGroupIdLookup(true);

    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    uint64_t code = STWErrorSuccess;
    auto groups = STWGroupManager::defaultManager()->groupContainerIdentifiersForOwnerIdentifier(
        ownerIdentifier, groupContainerClass, false, &code);
    if (!groups) {
        *error = code;
        return std::nullopt;
    }
    std::map<std::string, STWMetadataRef> containers;
    for (const std::string& group : *groups) {
        uint64_t groupCode = STWErrorSuccess;
        auto identity =
            STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group, groupContainerClass, &groupCode);
        std::shared_ptr<STWMetadata> container;
        if (identity)
            container = createOrLookupContainerWithContainerIdentity(identity, true, false, false, &groupCode);
        if (container)
            containers.emplace(group, std::move(container));
        else
            STW_LOG_ERROR(STWLogCategory::Tolvan, "Failed to create or lookup group container: %@ : %llu",
                          identity ? STWFormatArg(identity) : STWFormatArg(group), groupCode);
    }
    return containers;
}
