#include "Daemon/Request/STWRequestDispatcher.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "common/STWLog.h"
#include "platform/STWPeerConnection.h"

#include <cstring>

namespace {

// A caller's own entitlements go into the code-signing mapping, where the installer's
// information, when there is any, still wins. The decision never depends on the result.
void _processCallerRegisteredEntitlements(const STWClientIdentity& clientIdentity, STWCommandQueue& commandQueue) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    if (!mapping)
        return;
    uint64_t code = mapping->processCallerRegisteredEntitlements(clientIdentity.entitlements().value_or(STWValue::Dictionary()),
                                                                 clientIdentity.bundleIdentifier(), commandQueue);
    if (code != STWErrorSuccess)
        STW_LOG_FN("checkEntitlementsAndInitClientObject", STWLogLevel::Error, STWLogCategory::Tolvan,
                   "Error processing entitlements for %@ : %llu", clientIdentity.bundleIdentifier(), code);
}

} // namespace

std::shared_ptr<STWClientConnection>
STWRequestDispatcher::checkEntitlementsAndInitClientObject(const STWCommandTableEntry& entry,
                                                           const STWClientIdentityRef& clientIdentity,
                                                           const std::shared_ptr<STWCommandQueue>& commandQueue) {
    static constexpr const char* function = "checkEntitlementsAndInitClientObject";
    const char* required = entry.requiredEntitlement;
    bool entitled = false, allowOtherIdLookup = false, unrestricted = false;
    std::optional<STWValue::Dictionary> lookup;
    std::optional<STWValue::Array> wipeIdentifiers;

    if (!clientIdentity) {
        // Without an identity only the commands that admit anyone get a connection.
        if (!entry.allowsUnentitled)
            return nullptr;
        return std::make_shared<STWClientConnection>(nullptr, false, false, false, std::nullopt, std::nullopt,
                                                     commandQueue);
    }

    if (clientIdentity->boolValueOfEntitlement(STWEntitlementAllowed)) {
        allowOtherIdLookup = true;
        unrestricted = strcmp(required, STWEntitlementTestability) != 0;
    } else {
        allowOtherIdLookup = clientIdentity->boolValueOfEntitlement(STWEntitlementOtherIdLookup);
        if (entry.acceptsLookupEntitlement) {
            const STWValue* value = clientIdentity->entitlementValue(STWEntitlementLookup);
            if (value && value->dictionary())
                lookup = *value->dictionary();
        }
    }

    if (strcmp(required, STWEntitlementWipeContainer) == 0) {
        const STWValue* value = clientIdentity->entitlementValue(STWEntitlementWipeContainer);
        if (value && value->array()) {
            wipeIdentifiers = *value->array();
            entitled = true;
        } else {
            STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "No entitled containers to wipe");
            entitled = unrestricted;
        }
    } else {
        entitled = unrestricted || clientIdentity->boolValueOfEntitlement(required);
    }

    bool connects = entitled || entry.allowsUnentitled || lookup.has_value();
    if (!connects) {
        STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "connection attempt from pid %d (%@) is not entitled",
                   clientIdentity->posixPID(), clientIdentity->bundleIdentifier());
        return nullptr;
    }
    _processCallerRegisteredEntitlements(*clientIdentity, *commandQueue);
    return std::make_shared<STWClientConnection>(clientIdentity, entitled, allowOtherIdLookup, unrestricted,
                                                 std::move(lookup), std::move(wipeIdentifiers), commandQueue);
}

bool STWRequestDispatcher::dispatch(const STWValue::Dictionary& request, const STWReplyRef& reply,
                                    const STWClientIdentityRef& clientIdentity, uint64_t* error) {
    static constexpr const char* function = "STWProcessTolvanEvent";
    // An absent or mistyped "Command" reads as 0, like any absent key.
    uint64_t command = STWDictionaryUInt64(request, "Command").value_or(0);
    STW_LOG_FN(function, STWLogLevel::Debug, STWLogCategory::Tolvan, "begin TolvanEventProcessing command=%llu",
               command);
    *error = STWErrorSuccess;
    bool sendReply = true;
    std::shared_ptr<STWClientConnection> connection;

    if (command >= STWCommandCount) {
        STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "Invalid command index: %lld",
                   static_cast<int64_t>(command));
        *error = STWErrorUnsupportedCommand;
    } else if (STWCommandTable[command].command != command) {
        STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "Invalid command at index %llu", command);
        *error = STWErrorUnsupportedCommand;
    } else {
        const STWCommandTableEntry& entry = STWCommandTable[command];
        auto commandQueue = STWCommandQueue::init();
        connection = checkEntitlementsAndInitClientObject(entry, clientIdentity, commandQueue);
        if (!connection) {
            *error = STWErrorNotEntitled;
        } else {
            sendReply = entry.sendsReply != 0;
            try {
                entry.handler(request, reply, *connection, error);
                connection->completeWithError(error);
            } catch (const std::exception& e) {
                // Nothing a handler throws may take the connection's thread down.
                STW_LOG_FN(function, STWLogLevel::Error, STWLogCategory::Tolvan, "Got exception: %@ : %@",
                           "std::exception", e.what());
                *error = STWErrorException;
                sendReply = true;
            }
        }
    }

    std::optional<std::string> client = connection ? connection->clientBundleIdentifier() : std::nullopt;
    std::string clientName = client ? *client : "<unknown>";
    STW_LOG_FN(function, STWLogLevel::Debug, STWLogCategory::Tolvan,
               "end TolvanEventProcessing command=%llu clientIdentifier=%@", command, clientName);
    if (STWLog::isEnabled(STWLogLevel::Default)) {
        const std::string fields[] = {"STOWLY_COMMAND=" + std::to_string(command),
                                      "STOWLY_RESULT_CODE=" + std::to_string(*error)};
        STWLog::write(STWLogLevel::Default, STWLogCategory::Tolvan, {function, __FILE__, __LINE__},
                      STWFormat("command=%llu, client=%@, error=%llu", command, clientName, *error), nullptr, fields);
    }
    // A command that answers from its completion and did not fail up front leaves the
    // reply to that completion.
    return !(*error == STWErrorSuccess && !sendReply);
}

void STWRequestDispatcher::processTolvanEvent(const std::shared_ptr<STWPeerConnection>& peer, uint64_t requestID,
                                              const STWValue::Dictionary& request) {
    auto reply = std::make_shared<STWReply>(peer, requestID);
    uint64_t command = STWDictionaryUInt64(request, "Command").value_or(0);
    // Only commands that exist need to know who is asking; that is worked out once per
    // connection (a caller that is nobody stays nobody).
    struct Caller {
        STWClientIdentityRef identity;
    };
    STWClientIdentityRef clientIdentity;
    if (command < STWCommandCount) {
        auto caller = std::static_pointer_cast<const Caller>(peer->context());
        if (!caller) {
            caller = std::make_shared<const Caller>(Caller{STWClientIdentity::clientIdentityWithTolvanConnection(*peer)});
            peer->setContext(caller);
        }
        clientIdentity = caller->identity;
    }
    uint64_t error = STWErrorSuccess;
    if (dispatch(request, reply, clientIdentity, &error))
        reply->sendWithError(error);
}
