// The group side of the code-signing mapping: group identifiers derived from entitlements,
// the reference counts over every stored entry, and the release of groups that lost their
// last reference when an entry changes.
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWPerUserConfiguration.h"
#include "common/STWLog.h"
#include "platform/STWQueue.h"

#include <algorithm>

namespace {

constexpr auto kCategory = STWLogCategory::CodeSignMapping;
constexpr std::string_view kSystemGroupPrefix = "systemgroup.";

std::string describe(const STWGroupIdentifierList& list) {
    return STWValue(STWValue::Array(list.begin(), list.end())).description();
}

} // namespace

std::optional<STWGroupIdentifierList>
STWCodeSigningMapping::_copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                                     const STWValue::Dictionary& entitlements,
                                                                     const char* groupKey) {
    const STWValue* value = STWDictionaryFind(entitlements, groupKey);
    if (!value)
        return std::nullopt;
    STWGroupIdentifierList list;
    if (const std::string* single = value->string()) {
        list.push_back(*single);
    } else if (const STWValue::Array* array = value->array()) {
        for (const STWValue& element : *array) {
            const std::string* group = element.string();
            if (!group) {
                STW_LOG_ERROR(kCategory, "Entitlement %@ for %@ contains non-string values; ignoring.", groupKey,
                              identifier);
                return std::nullopt;
            }
            list.push_back(*group);
        }
    } else {
        STW_LOG_ERROR(kCategory, "Entitlement %@ for %@ does not contain supported types; ignoring.", groupKey,
                      identifier);
        return std::nullopt;
    }
    // A set: each entry counts once per group, whatever the order.
    std::sort(list.begin(), list.end());
    list.erase(std::unique(list.begin(), list.end()), list.end());
    return list;
}

std::optional<STWGroupIdentifierList> STWCodeSigningMapping::_appGroupIdentifiersForIdentifier(
    const std::string& identifier, const std::optional<STWValue::Dictionary>& entitlements) {
    if (!entitlements)
        return std::nullopt;
    return _copyApplicationGroupEntitlementForIdentifier(identifier, *entitlements, STWEntitlementKey::applicationGroups);
}

std::optional<STWGroupIdentifierList>
STWCodeSigningMapping::_unfilteredSystemGroupIdentifiers(const std::string& identifier,
                                                         const STWValue::Dictionary& entitlements) {
    auto groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements, STWEntitlementKey::systemGroups);
    if (!groups || groups->empty())
        groups = _copyApplicationGroupEntitlementForIdentifier(identifier, entitlements,
                                                               STWEntitlementKey::systemGroupContainers);
    return groups;
}

std::optional<STWGroupIdentifierList> STWCodeSigningMapping::_systemGroupIdentifiersForIdentifier(
    const std::string& identifier, const std::optional<STWValue::Dictionary>& entitlements) {
    if (!entitlements)
        return std::nullopt;
    auto groups = _unfilteredSystemGroupIdentifiers(identifier, *entitlements);
    if (groups)
        std::erase_if(*groups, [](const std::string& group) {
            if (group.starts_with(kSystemGroupPrefix))
                return false;
            STW_LOG_ERROR(kCategory, "System group ID %@ does not have proper prefix, ignoring.", group);
            return true;
        });
    return groups;
}

std::optional<STWReferenceCountSet> STWCodeSigningMapping::copyReferenceCountSetOfType(STWGroupType type) {
    return _queue->syncResult([&] { return std::optional<STWReferenceCountSet>(_onQueue_copyReferenceCountSetOfType(type)); });
}

STWReferenceCountSet STWCodeSigningMapping::_onQueue_copyReferenceCountSetOfType(STWGroupType type) {
    _assertOnQueue(__func__);
    STWReferenceCountSet counts;
    // Every stored entry counts, placeholders, advance copies and invalid ones included: a
    // group stays while anything installed or about to be installed names it.
    STWErrorRef error = _codeSigningMappingDB->enumerateIdentifiersAndCodeSigningInfoUsingBlock(
        [&](const std::string& identifier, const std::shared_ptr<STWCodeSigningEntry>& entry) {
            const STWValue::Dictionary* entitlements =
                entry->codeSigningInfo()
                    ? STWDictionaryDictionary(*entry->codeSigningInfo(), STWEntitlementKey::entitlements)
                    : nullptr;
            if (!entitlements)
                return;
            auto groups = type == STWGroupTypeSystem
                              ? _unfilteredSystemGroupIdentifiers(identifier, *entitlements)
                              : _copyApplicationGroupEntitlementForIdentifier(identifier, *entitlements,
                                                                              STWEntitlementKey::applicationGroups);
            if (!groups)
                return;
            STW_LOG_DEBUG(kCategory, "Entitlements for identifier %@ references container IDs: %@", identifier,
                          describe(*groups));
            for (const std::string& group : *groups)
                ++counts[group];
        },
        false);
    if (error)
        STW_LOG_ERROR(kCategory, "Failed to enumerate code signing info: %@", error);
    return counts;
}

void STWCodeSigningMapping::_onQueue_handleChangeFromOldGroupContainerIds(
    const std::optional<STWGroupIdentifierList>& oldIds, const std::optional<STWGroupIdentifierList>& newIds,
    STWGroupType type, STWCommandQueue& commandQueue) {
    _assertOnQueue(__func__);
    if ((!oldIds && !newIds) || (oldIds && newIds && *oldIds == *newIds))
        return;
    STWGroupIdentifierList removed;
    if (oldIds)
        for (const std::string& group : *oldIds)
            if (!newIds || std::find(newIds->begin(), newIds->end(), group) == newIds->end())
                removed.push_back(group);
    // Groups only in the new list are made when they are first looked up.
    _onQueue_removeReferenceForGroupIdentifiers(removed, type, commandQueue);
}

void STWCodeSigningMapping::_onQueue_removeReferenceForGroupIdentifiers(const STWGroupIdentifierList& identifiers,
                                                                        STWGroupType type,
                                                                        STWCommandQueue& commandQueue) {
    _assertOnQueue(__func__);
    if (identifiers.empty())
        return;
    if (type == STWGroupTypeSystem) {
        // System group containers outlive the entitlements of any one service.
        STW_LOG_NOTICE(kCategory, "Would have removed system group container references for %@", describe(identifiers));
        return;
    }
    STWReferenceCountSet counts = _onQueue_copyReferenceCountSetOfType(type);
    auto configuration = STWGlobalConfiguration::sharedInstance();
    _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock([&](const STWUserIdentityRef& user) {
        auto perUser = configuration->getPerUserConfigurationForUserIdentity(user);
        if (perUser && perUser->existsUserBaseDirectory())
            _onQueue_removeGroupContainersIfNeededforUserIdentity(user, STWContainerClassSharedAppGroup, identifiers,
                                                                  counts, commandQueue);
    });
}

void STWCodeSigningMapping::_onQueue_removeGroupContainersIfNeededforUserIdentity(
    const STWUserIdentityRef& userIdentity, STWContainerClass groupContainerClass,
    const STWGroupIdentifierList& identifiers, STWReferenceCountSet referenceCounts, STWCommandQueue& commandQueue) {
    _assertOnQueue(__func__);
    for (const std::string& group : identifiers) {
        int64_t& count = referenceCounts[group];
        // The counts still include the changing entry's old reference: 1 is that entry's
        // own, 0 means it never referenced the group.
        if (count == 1) {
            uint64_t code = STWErrorSuccess;
            auto identity =
                STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, group, groupContainerClass, &code);
            if (identity)
                commandQueue.insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                    {identity}, true, [group, userIdentity](uint64_t failure) {
                        STW_LOG_ERROR(kCategory, "Failed to destroy group container with identifier %@ for %@: %llu",
                                      group, userIdentity, failure);
                    }));
        } else {
            STW_LOG_NOTICE(kCategory, "Reference count for user: %@, ID: %@ is %ld", userIdentity, group, count);
        }
        --count;
    }
}
