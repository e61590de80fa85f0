// The handlers of the per-container service commands: info values (5, 6), UUID
// regeneration (9), disk usage (23), the retry self-test (25), staged shared content (26)
// and user-managed assets (28, 29).
#include "Daemon/Request/STWCommandHandlers.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/Request/STWRequestDecoder.h"
#include "common/STWError.h"
#include "common/STWLog.h"

namespace STWCommandHandlers {

namespace {

const STWValue& valueOrNull(const STWValue::Dictionary& request, const char* key) {
    static const STWValue null;
    const STWValue* value = STWDictionaryFind(request, key);
    return value ? *value : null;
}

// Commands 28 and 29: the application data container of "Identifier", for the user
// identity the caller means by it.
STWContainerIdentityRef assetsContainerIdentity(const STWValue::Dictionary& request, STWClientConnection& connection,
                                                uint64_t* error) {
    const std::string* identifier = STWDictionaryString(request, "Identifier");
    if (!identifier) {
        *error = STWErrorNoIdentifier;
        return nullptr;
    }
    auto userIdentity = STWRequestDecoder::userIdentityForContainerIdentifier(
        connection, STWContainerClassDataApplication, *identifier, error);
    if (!userIdentity && *error != STWErrorSuccess)
        return nullptr;
    return STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, *identifier,
                                                                   STWContainerClassDataApplication, error);
}

} // namespace

STW_COMMAND_HANDLER(setInfoValue) {
    (void)reply;
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (!identity)
        return;
    const STWValue* value = STWDictionaryFind(request, "Value");
    connection.setInfoValue(value ? std::optional<STWValue>(*value) : std::nullopt, valueOrNull(request, "Key"),
                            identity, true, error);
}

STW_COMMAND_HANDLER(infoValueForKey) {
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (!identity)
        return;
    if (auto value = connection.infoValueForKey(valueOrNull(request, "Key"), identity, true, error))
        reply->set("ReplyInfoValue", std::move(*value));
}

STW_COMMAND_HANDLER(regenerateDirectoryUUID) {
    (void)reply;
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (identity)
        connection.regenerateDirectoryUUIDWithContainerIdentity(identity, error);
}

STW_COMMAND_HANDLER(diskUsage) {
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (!identity)
        return;
    // Answered whenever the identity was made: 0 with the failure's code.
    reply->set("ReplyDiskUsage", STWValue(connection.diskUsageWithContainerIdentity(identity, error)));
}

STW_COMMAND_HANDLER(retryTest) {
    (void)reply;
    if (!STWGlobalConfiguration::sharedInstance()->isInternalImage()) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "People really shouldn't be calling this on non-internal installs!");
        return;
    }
    connection.retryTestWithNumCrashes(STWDictionaryUInt64(request, "NumRetryCrashes").value_or(0), error);
}

STW_COMMAND_HANDLER(stageSharedContent) {
    auto staged = connection.stageSharedContentForIdentifier(
        valueOrNull(request, "Identifier"), valueOrNull(request, "SourcePath"), valueOrNull(request, "DestPath"), error);
    if (staged)
        reply->set("ReplyPath", STWValue(staged->native()));
}

STW_COMMAND_HANDLER(userManagedAssetsPath) {
    auto identity = assetsContainerIdentity(request, connection, error);
    if (!identity)
        return;
    bool existed = false;
    auto path = connection.userManagedAssetsPathWithContainerIdentity(
        identity, STWDictionaryBool(request, "IsRelative"), STWDictionaryBool(request, "CreateIfNecessary"), &existed,
        error);
    if (!path)
        return;
    reply->set("ReplyPath", STWValue(*path));
    reply->set("ReplyExisted", STWValue(existed));
}

STW_COMMAND_HANDLER(deleteUserManagedAsset) {
    (void)reply;
    auto identity = assetsContainerIdentity(request, connection, error);
    if (!identity)
        return;
    const std::string* path = STWDictionaryString(request, "SourcePath");
    connection.deleteUserManagedAssetWithContainerIdentity(identity, path ? std::optional<std::string>(*path)
                                                                          : std::nullopt,
                                                           error);
}

} // namespace STWCommandHandlers
