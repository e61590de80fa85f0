#include "Daemon/Request/STWCommandHandlers.h"
#include "common/STWThreadSafety.h"

#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWTestLocks.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/Request/STWRequestDecoder.h"
#include "common/STWError.h"
#include "common/STWLog.h"

#include <mutex>

namespace STWCommandHandlers {

STW_COMMAND_HANDLER(createOrLookupContainer) {
    auto identity = STWRequestDecoder::classValidatedIdentity(request, connection, true, error);
    if (!identity)
        return;
    bool create = STWDictionaryBool(request, "CreateIfNecessary");
    bool transient = STWDictionaryBool(request, "Transient");
    auto container = connection.createOrLookupContainerWithContainerIdentity(identity, create, transient, true, error);
    if (!container)
        return;
    reply->set("ReplyUUID", STWValue(container->uuid()));
    reply->set("ReplyExisted", STWValue(container->existed()));
    reply->set("ReplyPath", STWValue(container->url().native()));
    reply->set("ReplyIdentifier", STWValue(container->identifier()));
    if (container->userIdentity() && container->userIdentity()->personaUniqueString())
        reply->set("ReplyPersonaUniqueString", STWValue(*container->userIdentity()->personaUniqueString()));
    STWRequestDecoder::issueSandboxExtension(reply->body(), "SandboxToken", *container, connection);
}

STW_COMMAND_HANDLER(containersWithClass) {
    STWContainerClass containerClass = STWDictionaryUInt64(request, "ContainerClass").value_or(0);
    auto containers = connection.containersWithClass(containerClass, STWDictionaryBool(request, "Transient"), error);
    if (!containers)
        return;
    STWValue::Array identifiers, uuids, personas;
    for (const auto& container : *containers) {
        identifiers.emplace_back(container->identifier());
        uuids.emplace_back(container->uuid());
        const auto& persona = container->userIdentity() ? container->userIdentity()->personaUniqueString() : std::nullopt;
        personas.emplace_back(persona ? *persona : std::string());
    }
    reply->set("ReplyIdsArray", STWValue(std::move(identifiers)));
    reply->set("ReplyUUIDsArray", STWValue(std::move(uuids)));
    reply->set("ReplyPersonaUniqueStringsArray", STWValue(std::move(personas)));
}

STW_COMMAND_HANDLER(containerMetadata) {
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (!identity)
        return;
    auto container = connection.metadataWithContainerIdentity(identity, error);
    if (!container)
        return;
    reply->set("ReplyPath", STWValue(container->url().native()));
    reply->set("ReplyTransient", STWValue(container->transient()));
    if (STWDictionaryBool(request, "InfoDictRequested") && container->info())
        reply->set("ReplyInfoDictionary", STWValue(*container->info()));
    STWRequestDecoder::issueSandboxExtension(reply->body(), "SandboxToken", *container, connection);
}

STW_COMMAND_HANDLER(recreateDefaultStructure) {
    (void)reply;
    auto identity = STWRequestDecoder::concreteIdentityFromKeys(request, connection, {}, error);
    if (identity)
        connection.recreateDefaultStructureWithContainerIdentity(identity, error);
}

STW_COMMAND_HANDLER(replaceContainer) {
    (void)reply;
    // Without "OldIdentifier", or without a UUID for it, there is no old container: the new
    // one becomes live under its own UUID.
    STWConcreteContainerIdentityRef oldIdentity;
    if (STWDictionaryFind(request, "OldIdentifier")) {
        oldIdentity = STWRequestDecoder::concreteIdentityFromKeys(
            request, connection, {"OldIdentifier", "OldContainerClass", "OldContainerUUID", "OldPersonaUniqueString"},
            error);
        if (!oldIdentity)
            return;
        const STWValue* uuid = STWDictionaryFind(request, "OldContainerUUID");
        if (!uuid || !uuid->uuid())
            oldIdentity = nullptr;
    }
    auto newIdentity = STWRequestDecoder::concreteIdentityFromKeys(
        request, connection, {"NewIdentifier", "NewContainerClass", "NewContainerUUID", "NewPersonaUniqueString"},
        error);
    if (newIdentity)
        connection.replaceContainerIdentity(oldIdentity, newIdentity, false, false, error);
}

STW_COMMAND_HANDLER(stageContainerForDelete) {
    (void)reply;
    static const STWValue::Array none;
    auto arrayOf = [&](const char* key) -> const STWValue::Array& {
        const STWValue* value = STWDictionaryFind(request, key);
        return value && value->array() ? *value->array() : none;
    };
    const STWValue::Array& classes = arrayOf("ContainerClassesArray");
    const STWValue::Array& uuids = arrayOf("UUIDsArray");
    const STWValue::Array& identifiers = arrayOf("IdentifiersArray");
    const STWValue::Array& personas = arrayOf("PersonaUniqueStringsArray");
    if (classes.size() != uuids.size() || identifiers.size() != classes.size() || personas.size() != classes.size()) {
        STW_LOG_FN("stageContainerForDelete", STWLogLevel::Error, STWLogCategory::Tolvan,
                   "Can't act on an invalid input: UUIDString count: %ld, class count: %ld, ID count: %lu, persona "
                   "string count: %lu",
                   uuids.size(), classes.size(), identifiers.size(), personas.size());
        *error = STWErrorInvalidArgument;
        return;
    }
    std::vector<STWContainerIdentityRef> identities;
    for (size_t i = 0; i < classes.size(); ++i) {
        STWContainerClass containerClass = classes[i].uint64Value().value_or(0);
        STWUserIdentityRef userIdentity;
        if (STWUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
            const std::string* persona = personas[i].string();
            userIdentity = STWRequestDecoder::userIdentityForPersonaUniqueString(
                connection, persona ? std::optional<std::string>(*persona) : std::nullopt, error);
        } else {
            userIdentity = STWUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentContext();
        }
        if (!userIdentity)
            return; // nothing is queued
        uint64_t code = STWErrorSuccess;
        const STWUUID* uuid = uuids[i].uuid();
        auto identity = uuid ? STWConcreteContainerIdentity::containerIdentityWithUUID(*uuid, userIdentity,
                                                                                       identifiers[i], containerClass,
                                                                                       &code)
                             : nullptr;
        if (identity)
            identities.push_back(std::move(identity));
        else
            *error = uuid ? code : uint64_t{STWErrorInvalidClass};
    }
    connection.commandQueue()->insertCommand(
        STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(std::move(identities), true, nullptr));
}

STW_COMMAND_HANDLER(deleteContainersOnDeathRow) {
    (void)request;
    (void)connection;
    (void)error;
    // The reply waits for the pass.
    STWClientConnection::deleteContainersOnDeathRowWithCompletion(
        [reply](uint64_t code) { reply->sendWithError(code); });
}

STW_COMMAND_HANDLER(setDataProtection) {
    auto identity = STWRequestDecoder::classValidatedIdentity(request, connection, false, error);
    if (!identity)
        return;
    const STWValue* value = STWDictionaryFind(request, "DataProtectionClass");
    // Absent: 0, no class.
    auto number = value ? value->truncatedInt64Value() : std::optional<int64_t>(0);
    if (!number || *number < INT32_MIN || *number > INT32_MAX) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Invalid data protection class: %@", value ? STWFormatArg(*value) : nullptr);
        *error = STWErrorInvalidArgument;
        return;
    }
    // The reply waits for the change; one that waits for an unlock is parked on the
    // lock-state queue, whose items hold an IPC transaction until they ran.
    STWDataProtectionManager::defaultManager()->setDataProtectionOnDataContainerForContainerIdentity(
        identity, static_cast<int32_t>(*number), STWDictionaryBool(request, "IsThirdParty"),
        STWDictionaryBool(request, "RetryIfLocked"), [reply](uint64_t code) { reply->sendWithError(code); });
}

STW_COMMAND_HANDLER(deleteContainer) {
    (void)reply;
    auto identity = STWRequestDecoder::classValidatedIdentity(request, connection, false, error);
    if (identity)
        connection.deleteContainerWithContainerIdentity(identity, STWDictionaryBool(request, "Transient"), error);
}

namespace {

// Commands 11 and 12: the container of "Identifier" in `containerClass`, wiped.
void _wipe(const STWValue::Dictionary& request, STWClientConnection& connection, STWContainerClass containerClass,
           uint64_t* error) {
    const std::string* identifier = STWDictionaryString(request, "Identifier");
    if (!identifier) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Can't wipe container with nil identifier: %@", nullptr);
        *error = STWErrorNoIdentifier;
        return;
    }
    auto userIdentity =
        STWRequestDecoder::userIdentityForContainerIdentifier(connection, containerClass, *identifier, error);
    if (!userIdentity)
        return;
    auto identity =
        STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, *identifier, containerClass, error);
    if (identity)
        connection.deleteDataContainerContentWithContainerIdentity(identity, error);
}

} // namespace

STW_COMMAND_HANDLER(wipeContainer) {
    (void)reply;
    _wipe(request, connection, STWContainerClassDataQuilletPlugin, error);
}

STW_COMMAND_HANDLER(deleteContainerContent) {
    (void)reply;
    connection.setUnrestricted(true);
    _wipe(request, connection, STWDictionaryUInt64(request, "ContainerClass").value_or(0), error);
}

STW_COMMAND_HANDLER(recreateDefaultStructure2) { recreateDefaultStructure(request, reply, connection, error); }

STW_COMMAND_HANDLER(unsupportedCommand) {
    (void)request;
    (void)reply;
    (void)connection;
    *error = STWErrorUnsupportedCommand;
}

STW_COMMAND_HANDLER(setTestLock) {
    (void)reply;
    (void)connection;
    if (!STWGlobalConfiguration::sharedInstance()->isInternalImage()) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Unsupported call to set lock!");
        return;
    }
    // Which test locks this command holds, one bit per lock, across requests.
    static STWMutex heldLock;
    static uint32_t held STW_GUARDED_BY(heldLock) = 0;
    uint64_t lock = STWDictionaryUInt64(request, "TestLock").value_or(0);
    bool enable = STWDictionaryBool(request, "Enable");
    auto testLocks = STWTestLocks::sharedInstance();
    if (lock == STWTestLocks::lockCount && !enable) {
        testLocks->setEnabled(false);
        return;
    }
    if (lock >= STWTestLocks::lockCount) {
        *error = STWErrorInvalidArgument;
        return;
    }
    uint32_t bit = 1u << lock;
    if (enable) {
        {
            STWLockGuard guard(heldLock);
            if (held & bit)
                return;
            held |= bit; // claimed before the acquire, which may wait
        }
        testLocks->setEnabled(true);
        // Not under heldLock: acquiring lock 1 waits for the daemon-wide lock, and the
        // release that lets a parked request finish must still get in.
        if (!testLocks->acquireLock(lock)) {
            STWLockGuard guard(heldLock);
            held &= ~bit;
            *error = STWErrorInvalidArgument;
        }
        return;
    }
    STWLockGuard guard(heldLock);
    if (!(held & bit))
        return;
    // The two daemon-wide locks are one bit pair: releasing either clears both.
    held &= lock <= 1 ? ~3u : ~bit;
    testLocks->releaseLock(lock);
    if (held == 0)
        testLocks->setEnabled(false);
}

} // namespace STWCommandHandlers
