// The get-process-containers routine and the start of the server.
#include "upcall/STWKernServer.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWLog.h"
#include "platform/STWEventLoop.h"
#include "platform/STWPersonaService.h"
#include "platform/STWPlatformConfiguration.h"
#include "upcall/STWKernProcessContainers.h"
#include "upcall/STWUpcallListener.h"

#include <algorithm>

#define STW_ROUTINE_LOG(level, ...) \
    STW_LOG_FN("server_get_process_containers", level, STWLogCategory::Upcall, __VA_ARGS__)

namespace {

// Made once by STWKernServerStart and kept for the life of the process: its thread and
// the event loop's handlers refer to it.
STWUpcallListener* upcallListener = nullptr;

// The data-container class the code-signing mapping recorded for `identifier` (0 when
// none is recorded: the container type the kernel sends decides).
uint64_t _dataContainerClassForIdentifier(const std::string& identifier) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    return mapping ? mapping->dataContainerTypeForIdentifier(identifier) : 0;
}

// The persona type number the kernel keeps for `personaID`, from the persona list.
std::optional<uint32_t> _kernelPersonaType(uint32_t personaID) {
    for (const STWPersonaRecord& record : STWPersonaService::sharedInstance()->personaList())
        if (record.personaID == personaID)
            return record.kernelType;
    return std::nullopt;
}

// The user whose containers the process uses; 4 (a fault logged) when there is none.
STWKernReturn _userIdentityForRequest(const STWKernProcessContainersRequest& request, STWUserIdentityRef* userIdentity) {
    auto cache = STWContainerCache::sharedInstance()->userIdentityCache();
    if (STWPlatformConfiguration::sharedInstance()->isMultiUser()) {
        *userIdentity = cache->userIdentityForPersonalPersonaWithUID(request.uid, request.uid);
    } else if (request.personaID == STWKernNoPersona) {
        *userIdentity = cache->userIdentityForPersonalPersona();
    } else {
        std::optional<uint32_t> type = _kernelPersonaType(request.personaID);
        if (!type) {
            STW_ROUTINE_LOG(STWLogLevel::Fault, "%s: Could not look up info for persona id %u",
                            "server_get_process_containers", request.personaID);
            return STWKernInvalidArgument;
        }
        *userIdentity = *type == 2 || *type == 5 ? cache->userIdentityWithPersonaID(request.personaID)
                                                 : cache->userIdentityForPersonalPersona();
    }
    if (!*userIdentity) {
        STW_ROUTINE_LOG(STWLogLevel::Fault, "%s: Unable to find user identity for persona id %u",
                        "server_get_process_containers", request.personaID);
        return STWKernInvalidArgument;
    }
    return STWKernSuccess;
}

// The class of the process's data container: the recorded one where it is a per-user
// class (a plug-in stays a plug-in whatever was recorded), else what the container type says.
STWContainerClass _dataContainerClass(const std::string& identifier, uint32_t containerType) {
    uint64_t recorded = _dataContainerClassForIdentifier(identifier);
    if (STWContainerClassIsPerUser(recorded)) {
        if (containerType == STWKernContainerTypePlugin && recorded != 4) {
            STW_ROUTINE_LOG(STWLogLevel::Notice, "SB Type: %u, Setwright Type: %llu.  Declaring this a plugin",
                            containerType, recorded);
            return 4;
        }
        if (containerType == STWKernContainerTypeApplication && recorded != 2)
            STW_ROUTINE_LOG(STWLogLevel::Notice, "SB type is app, but Setwright type is %llu", recorded);
        return recorded;
    }
    STW_ROUTINE_LOG(STWLogLevel::Error, "Invalid data container class for %@: %llu", identifier, recorded);
    STWContainerClass fallback = containerType == STWKernContainerTypePlugin ? 4 : 2;
    STW_ROUTINE_LOG(STWLogLevel::Notice, "SB Type: %u, falling back to class: %llu", containerType, fallback);
    return fallback;
}

// The privileged connection upcalls for `userIdentity` go through. Kept from one upcall to
// the next while the user identity stays the same object: it is the same connection every
// time (no client, no entitlements to decide, every look-up allowed), and creating or looking
// up containers leaves nothing on it, so making one per upcall only cost allocations. Per
// thread, as upcalls are served on one.
const std::shared_ptr<STWClientConnection>& _privilegedConnectionForUserIdentity(const STWUserIdentityRef& userIdentity) {
    thread_local STWUserIdentityRef cachedUserIdentity;
    thread_local std::shared_ptr<STWClientConnection> cachedConnection;
    if (!cachedConnection || cachedUserIdentity != userIdentity) {
        cachedConnection = STWClientConnection::privilegedClientConnectionWithUserIdentity(userIdentity);
        cachedConnection->setAllowOtherIdLookup(true);
        cachedConnection->setAllowGroupIdLookup(true);
        cachedConnection->setUnrestricted(true);
        cachedUserIdentity = userIdentity;
    }
    return cachedConnection;
}

void _checkUID(const STWClientConnection& connection, STWContainerClass containerClass, uint32_t uid) {
    uid_t expected = connection.clientIdentity()->posixUIDForContainerClass(containerClass);
    if (uid != expected)
        STW_ROUTINE_LOG(STWLogLevel::Error, "Invalid UID from kernel: %u, expected: %u", uid, expected);
}

// The container's path, created when it does not exist; nullopt (logged with `failure`)
// when it cannot be had.
std::optional<std::string> _createOrLookup(STWClientConnection& connection, const STWUserIdentityRef& userIdentity,
                                           const std::string& identifier, STWContainerClass containerClass,
                                           const char* failure) {
    uint64_t error = STWErrorSuccess;
    bool existed = false;
    auto identity =
        STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, identifier, containerClass, &error);
    STWMetadataRef container =
        identity ? connection.createOrLookupContainerRecordWithContainerIdentity(identity, true, false, true, &existed,
                                                                                  &error)
                 : nullptr;
    if (!container) {
        STW_ROUTINE_LOG(STWLogLevel::Error, failure, error);
        return std::nullopt;
    }
    return container->urlString();
}

void _logContainers(const std::string& identifier, const STWKernProcessContainersRequest& request,
                    const STWKernProcessContainersReply& reply) {
    if (!STWLog::isEnabled(STWLogLevel::Debug))
        return;
    auto dictionary = [](const std::vector<std::pair<std::string, std::string>>& pairs) {
        STWValue::Dictionary d;
        for (const auto& [key, path] : pairs)
            d[key] = STWValue(path);
        return STWValue(std::move(d));
    };
    auto text = [](const std::optional<std::string>& path) { return path ? *path : std::string("(null)"); };
    STW_ROUTINE_LOG(STWLogLevel::Debug, "UPCALL-Containers for %@(%u):", identifier, request.uid);
    STW_ROUTINE_LOG(STWLogLevel::Debug, "dataContainerURL: %@", text(reply.dataContainer));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "tempContainerURL: %@", text(reply.tempDirectory));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "homeDirURL: %@", text(reply.homeDirectory));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "groupURLs: %@", dictionary(reply.appGroups));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "systemContainerURL: %@", text(reply.systemContainer));
    STW_ROUTINE_LOG(STWLogLevel::Debug, "systemGroupURLs: %@", dictionary(reply.systemGroups));
}

} // namespace

STWKernReturn server_get_process_containers(const void* requestMemory, uint32_t requestSize, STWAuditToken auditToken,
                                            void** replyMemory, uint32_t* replySize, bool* deallocate) {
    if (auditToken.pid() != 0)
        return STWKernFailure;
    STW_ROUTINE_LOG(STWLogLevel::Debug, "request size: %u (%p)", requestSize, requestMemory);
    STWKernProcessContainersRequest request;
    if (STWKernReturn code = STWKernProcessContainersRequest::decode(requestMemory, requestSize, &request))
        return code;

    STWUserIdentityRef userIdentity;
    if (STWKernReturn code = _userIdentityForRequest(request, &userIdentity))
        return code;
    const std::shared_ptr<STWClientConnection>& connection = _privilegedConnectionForUserIdentity(userIdentity);

    // Every named container is made, whatever failed before it; one failure turns the status to 0.
    STWKernProcessContainersReply reply;
    auto make = [&](const std::string& identifier, STWContainerClass containerClass, const char* failure) {
        auto path = _createOrLookup(*connection, userIdentity, identifier, containerClass, failure);
        if (!path)
            reply.status = 0;
        return path;
    };
    const std::optional<std::string>& identifier = request.identifier();
    if (identifier) {
        STWContainerClass dataClass = _dataContainerClass(*identifier, request.containerType);
        _checkUID(*connection, dataClass, request.uid);
        reply.dataContainer = make(*identifier, dataClass, "createOrLookupContainerForUser: Failed with error: %llu");
    }
    if (request.systemContainerIdentifier)
        reply.systemContainer = make(*request.systemContainerIdentifier, 12,
                                     "createOrLookupContainerForUser:(system container) Failed with error: %llu");
    if (!request.appGroupIdentifiers.empty())
        _checkUID(*connection, 7, request.uid);
    for (const std::string& group : request.appGroupIdentifiers)
        if (auto path = make(group, 7, "createOrLookupGroupContainersForUser: Failed with error: %llu"))
            reply.appGroups.emplace_back(group, std::move(*path));
    for (const std::string& group : request.systemGroupIdentifiers)
        if (auto path = make(group, 13, "createOrLookupContainerForUser:(system group container) Failed with error: %llu"))
            reply.systemGroups.emplace_back(group, std::move(*path));

    if (reply.status == 1) {
        if (reply.dataContainer) {
            // As std::filesystem::path's "/" would join them, without parsing the path.
            std::string& temp = reply.tempDirectory.emplace(*reply.dataContainer);
            if (!temp.empty() && temp.back() != '/')
                temp += '/';
            temp += "tmp";
        }
        reply.homeDirectory = request.uid == 0
                                  ? STWPlatformConfiguration::sharedInstance()->resolve("/private/var/root").native()
                                  : userIdentity->homeDirectoryURL().native();
        _logContainers(identifier.value_or(""), request, reply);
    }
    return reply.copyOut(replyMemory, replySize, deallocate);
}

bool STWKernServerStart() {
    auto listener = std::make_unique<STWUpcallListener>(
        STWPlatformConfiguration::sharedInstance()->runtimeDirectory() / "upcall.sock");
    STWErrorRef error;
    if (!listener->checkIn(&error)) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "bootstrap_check_in: %s", error->message());
        return false;
    }
    if (!listener->resume(STWEventLoop::main(), &error)) {
        STW_LOG_ERROR(STWLogCategory::Upcall, "Cannot serve the upcall socket: %s", error->message());
        return false;
    }
    upcallListener = listener.release();
    return true;
}

bool STWKernServerStop(std::chrono::steady_clock::duration timeout) {
    return !upcallListener || upcallListener->stop(timeout);
}
