#include "Daemon/CodeSigning/STWGroupManager.h"

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWPerUserConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/STWLocks.h"
#include "common/STWException.h"
#include "common/STWLog.h"

namespace {

constexpr auto kCategory = STWLogCategory::CodeSignMapping;

} // namespace

const std::shared_ptr<STWGroupManager>& STWGroupManager::defaultManager() {
    static const std::shared_ptr<STWGroupManager> manager =
        std::make_shared<STWGroupManager>(STWUserIdentitySharedCache::sharedInstance());
    return manager;
}

STWGroupManager::STWGroupManager(std::shared_ptr<STWUserIdentityCache> userIdentityCache)
    : _userIdentityCache(std::move(userIdentityCache)) {}

void STWGroupManager::reconcileGroupContainersOfType(STWGroupType type, STWCommandQueue& commandQueue) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    std::optional<STWReferenceCountSet> counts = mapping ? mapping->copyReferenceCountSetOfType(type) : std::nullopt;
    if (!counts) {
        STW_LOG_ERROR(kCategory, "Failed to get reference count information for group type: %ld",
                      static_cast<int64_t>(type));
        return;
    }
    if (type == STWGroupTypeSystem) {
        _cleanupUnreferencedGroupContainersForUserIdentity(STWUserIdentityCache::defaultUserIdentity(),
                                                           STWContainerClassSharedSystemGroup, *counts, commandQueue);
        return;
    }
    auto configuration = STWGlobalConfiguration::sharedInstance();
    _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const STWUserIdentityRef& user) {
        auto perUser = configuration->getPerUserConfigurationForUserIdentity(user);
        if (perUser && perUser->existsUserBaseDirectory())
            _cleanupUnreferencedGroupContainersForUserIdentity(user, STWContainerClassSharedAppGroup, *counts,
                                                               commandQueue);
    });
}

void STWGroupManager::_cleanupUnreferencedGroupContainersForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                         STWContainerClass containerClass,
                                                                         const STWReferenceCountSet& referenceCounts,
                                                                         STWCommandQueue& commandQueue) {
    STWErrorRef error;
    auto containers =
        STWContainerCache::sharedInstance()->allContainersForUserIdentity(userIdentity, containerClass, false, &error);
    if (!containers) {
        STW_LOG_ERROR(kCategory, "Failed to fetch group container list for %@: %@", userIdentity, error);
        return;
    }
    for (const STWMetadataRef& container : *containers) {
        auto count = referenceCounts.find(container->identifier());
        if (count != referenceCounts.end() && count->second != 0)
            continue;
        std::string group = container->identifier();
        STW_LOG_NOTICE(kCategory, "Removing group container %@ for %@ at %@", group, userIdentity, container->url());
        commandQueue.insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {container->containerIdentity()}, false, [group, userIdentity](uint64_t failure) {
                STW_LOG_ERROR(kCategory, "Failed to destroy group container with identifier %@ for %@: %llu", group,
                              userIdentity, failure);
            }));
    }
}

std::optional<STWGroupIdentifierList>
STWGroupManager::groupContainerIdentifiersForOwnerIdentifier(const std::optional<std::string>& ownerIdentifier,
                                                             STWContainerClass groupContainerClass, bool useLocking,
                                                             uint64_t* error) {
    uint64_t code = STWErrorSuccess;
    std::optional<STWGroupIdentifierList> groups;
    if (!ownerIdentifier) {
        STW_LOG_ERROR(kCategory, "Can't act on an invalid object: ID: %@", nullptr);
        code = STWErrorInvalidClass;
    } else {
        try {
            STWAllIdentifiersLockGuard lock(STWLockMode::Writing, useLocking);
            auto mapping = STWCodeSigningMapping::sharedInstance();
            if (mapping)
                groups = groupContainerClass == STWContainerClassSharedSystemGroup
                             ? mapping->systemGroupIdentifiersForIdentifier(*ownerIdentifier)
                             : mapping->appGroupIdentifiersForIdentifier(*ownerIdentifier);
            if (!groups)
                groups = STWGroupIdentifierList();
        } catch (...) {
            STWErrorForCurrentException(__func__, __LINE__,
                                        STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage()));
            groups = std::nullopt;
            code = STWErrorException;
        }
    }
    if (error)
        *error = code;
    return groups;
}
