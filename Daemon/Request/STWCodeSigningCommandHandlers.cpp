// The handlers of the group, system-container and code-signing commands (13 to 20).
#include "Daemon/Request/STWCommandHandlers.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWGroupManager.h"
#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/Request/STWRequestDecoder.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"

#include <algorithm>

namespace STWCommandHandlers {

namespace {

// "ReplyGroupContainerDict": group identifier -> path.
STWValue::Dictionary pathsOf(const std::map<std::string, STWMetadataRef>& containers) {
    STWValue::Dictionary paths;
    for (const auto& [group, container] : containers)
        paths[group] = STWValue(container->url().native());
    return paths;
}

// The shared mapping; 66 when its database could not be opened.
std::shared_ptr<STWCodeSigningMapping> mappingOrFail(uint64_t* error) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    if (!mapping)
        *error = STWErrorDatabase;
    return mapping;
}

std::optional<STWValue::Dictionary> dictionaryValue(const STWValue::Dictionary& request, const char* key) {
    const STWValue::Dictionary* dictionary = STWDictionaryDictionary(request, key);
    return dictionary ? std::optional<STWValue::Dictionary>(*dictionary) : std::nullopt;
}

} // namespace

STW_COMMAND_HANDLER(createOrLookupGroupContainers) {
    auto owner = STWRequestDecoder::identifierOrCaller(request, connection);
    if (!owner) {
        *error = STWErrorNoIdentifier;
        return;
    }
    auto userIdentity = STWRequestDecoder::userIdentityForGroupOwner(connection, *owner, error);
    if (!userIdentity && *error != STWErrorSuccess)
        return;
    auto groups =
        connection.groupContainersForOwnerIdentifier(*owner, userIdentity, STWContainerClassSharedAppGroup, error);
    if (!groups)
        return;
    reply->set("ReplyGroupContainerDict", STWValue(pathsOf(*groups)));
    const STWClientIdentityRef& client = connection.clientIdentity();
    if (!client || !client->isSandboxed())
        return;
    STWValue::Dictionary tokens;
    for (const auto& [group, container] : *groups)
        STWRequestDecoder::issueSandboxExtension(tokens, group, *container, connection);
    if (!tokens.empty())
        reply->set("SandboxTokenDict", STWValue(std::move(tokens)));
}

STW_COMMAND_HANDLER(groupContainerIdentifiers) {
    auto groups = STWGroupManager::defaultManager()->groupContainerIdentifiersForOwnerIdentifier(
        STWRequestDecoder::identifierOrCaller(request, connection), STWContainerClassSharedAppGroup, true, error);
    if (groups)
        reply->set("ReplyGroupIdentifiersArray", STWValue(STWValue::Array(groups->begin(), groups->end())));
}

STW_COMMAND_HANDLER(systemContainerPath) {
    auto identifier = STWRequestDecoder::identifierOrCaller(request, connection);
    if (!identifier) {
        *error = STWErrorNoIdentifier;
        return;
    }
    // Anyone may find a well-known system container.
    if (*identifier != connection.clientBundleIdentifier() && !connection.allowOtherIdLookup() &&
        STWWhitelist::sharedWhitelist()->systemContainerIdIsWellknown(*identifier))
        connection.setAllowOtherIdLookup(true);
    auto userIdentity = STWRequestDecoder::userIdentityForContainerIdentifier(connection, STWContainerClassDataSystem,
                                                                              *identifier, error);
    if (!userIdentity && *error != STWErrorSuccess)
        return;
    auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, *identifier,
                                                                            STWContainerClassDataSystem, error);
    if (!identity)
        return;
    if (auto container = connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, error))
        reply->set("ReplyPath", STWValue(container->url().native()));
}

STW_COMMAND_HANDLER(systemGroupContainers) {
    auto owner = STWRequestDecoder::identifierOrCaller(request, connection);
    if (!owner) {
        *error = STWErrorNoIdentifier;
        return;
    }
    auto userIdentity = STWRequestDecoder::userIdentityForContainerIdentifier(
        connection, STWContainerClassSharedSystemGroup, *owner, error);
    if (!userIdentity && *error != STWErrorSuccess)
        return;
    auto groups =
        connection.groupContainersForOwnerIdentifier(*owner, userIdentity, STWContainerClassSharedSystemGroup, error);
    if (groups)
        reply->set("ReplyGroupContainerDict", STWValue(pathsOf(*groups)));
}

STW_COMMAND_HANDLER(systemGroupContainerPath) {
    static constexpr const char* function = "systemGroupContainerPath";
    auto owner = STWRequestDecoder::identifierOrCaller(request, connection);
    const std::string* group = STWDictionaryString(request, "GroupIdentifier");
    if (!owner || !group) {
        *error = STWErrorNoIdentifier;
        return;
    }
    std::optional<std::string> client = connection.clientBundleIdentifier();
    auto mapping = STWCodeSigningMapping::sharedInstance();
    // What the caller itself is entitled to, whoever the owner is.
    auto entitled = mapping && client ? mapping->systemGroupIdentifiersForIdentifier(*client) : std::nullopt;
    STW_LOG_DEBUG(STWLogCategory::Tolvan, "Group ID: %@, bundle ID: %@, entitled group container IDs: %@", *group,
                  client ? STWFormatArg(*client) : STWFormatArg(nullptr),
                  entitled ? STWValue(STWValue::Array(entitled->begin(), entitled->end())).description() : "(null)");
    auto userIdentity = STWRequestDecoder::userIdentityForContainerIdentifier(
        connection, STWContainerClassSharedSystemGroup, *owner, error);
    if (!userIdentity && *error != STWErrorSuccess) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Could not generate a user identity for bundle: %@, class: %llu, error: %llu",
                      *owner, uint64_t{STWContainerClassSharedSystemGroup}, *error);
        return;
    }
    std::optional<std::string> path;
    if (entitled && std::find(entitled->begin(), entitled->end(), *group) != entitled->end()) {
        auto groups = connection.groupContainersForOwnerIdentifier(*owner, userIdentity,
                                                                   STWContainerClassSharedSystemGroup, error);
        if (!groups)
            STW_LOG_ERROR(STWLogCategory::Tolvan, "No results returned for group container query for identity: %@, error: %llu",
                          *owner, *error);
        else if (auto found = groups->find(*group); found != groups->end())
            path = found->second->url().native();
    } else {
        bool passes = STWWhitelist::sharedWhitelist()->systemGroupContainerIdIsWellknown(*group) ||
                      connection.allowGroupIdLookup();
        if (!passes) {
            // A group that services probe for without being entitled: refused, not logged.
            if (*group != "systemgroup.com.vorlane.hornbeam")
                STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan,
                           "%@ is not entitled for system group identifier: %@.  Only entitled for: %@",
                           client ? STWFormatArg(*client) : STWFormatArg(nullptr), *group,
                           entitled ? STWValue(STWValue::Array(entitled->begin(), entitled->end())).description()
                                    : "(null)");
            *error = STWErrorNotEntitled;
            return;
        }
        connection.setAllowGroupIdLookup(true);
        auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(
            userIdentity, *group, STWContainerClassSharedSystemGroup, error);
        if (!identity) {
            STW_LOG_ERROR(STWLogCategory::Tolvan,
                          "Could not generate a container identity for system group lookup identifier: %@, class: %llu, "
                          "userIdentity: %@, error: %llu",
                          *group, uint64_t{STWContainerClassSharedSystemGroup}, userIdentity, *error);
            return;
        }
        auto container = connection.createOrLookupContainerWithContainerIdentity(identity, true, false, true, error);
        if (!container) {
            STW_LOG_ERROR(STWLogCategory::Tolvan, "No results returned for system group lookup identity: %@, error: %llu",
                          identity, *error);
            return;
        }
        path = container->url().native();
    }
    if (path) {
        reply->set("ReplyPath", STWValue(*path));
    } else if (*error == STWErrorSuccess) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Did not find system group container with identifier: %@ for %@", *group,
                      *owner);
        *error = STWErrorNotFound;
    }
}

STW_COMMAND_HANDLER(processCodeSigningInfo) {
    (void)reply;
    auto mapping = mappingOrFail(error);
    if (!mapping)
        return;
    const std::string* identifier = STWDictionaryString(request, "Identifier");
    uint64_t code = mapping->processCodeSigningInfo(dictionaryValue(request, "CodeSigningInfo"),
                                                    identifier ? std::optional<std::string>(*identifier) : std::nullopt,
                                                    dictionaryValue(request, "OptionsDictionary"),
                                                    *connection.commandQueue());
    if (code != STWErrorSuccess)
        *error = code;
    else
        STW_CRASH_POINT(STWCrashPoint::codeSigningAfterUpdate);
}

STW_COMMAND_HANDLER(codeSigningInfo) {
    (void)connection;
    auto mapping = mappingOrFail(error);
    if (!mapping)
        return;
    const std::string* identifier = STWDictionaryString(request, "Identifier");
    auto info = identifier ? mapping->getCodeSigningInfoForIdentifier(*identifier) : std::nullopt;
    if (!info) {
        *error = STWErrorNotFound;
        return;
    }
    reply->set("ReplyInfoDictionary", STWValue(std::move(*info)));
}

STW_COMMAND_HANDLER(invalidateCodeSigningInfo) {
    (void)request;
    (void)reply;
    (void)connection;
    auto mapping = mappingOrFail(error);
    if (!mapping)
        return;
    uint64_t code = mapping->invalidateCodeSigningInfoForAppsWithoutBundleContainer();
    if (code != STWErrorSuccess)
        *error = code;
}

} // namespace STWCommandHandlers
