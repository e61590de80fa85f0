#include "Daemon/Request/STWRequestDecoder.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWSandboxExtension.h"

namespace {

STWUserIdentityRef callerUserIdentity(const STWClientConnection& connection) {
    return connection.clientIdentity() ? connection.clientIdentity()->userIdentity() : nullptr;
}

std::string describeSet(const STWUserIdentitySet& identities) {
    std::string text = "{";
    for (const auto& identity : identities)
        text += (text.size() > 1 ? ", " : "") + identity->shortDescription();
    return text + "}";
}

} // namespace

std::optional<std::string> STWRequestDecoder::identifierOrCaller(const STWValue::Dictionary& request,
                                                                 const STWClientConnection& connection,
                                                                 const char* key) {
    if (const std::string* identifier = STWDictionaryString(request, key))
        return *identifier;
    return connection.clientBundleIdentifier();
}

STWUserIdentityRef STWRequestDecoder::userIdentityForContainerIdentifier(const STWClientConnection& connection,
                                                                         STWContainerClass containerClass,
                                                                         const std::string& identifier,
                                                                         uint64_t* error) {
    STWUserIdentityRef caller = callerUserIdentity(connection);
    if (!caller || !STWContainerClassIsPerUser(containerClass) || !caller->isNoSpecificPersona())
        return caller;
    // Plug-in data belongs to the persona of its parent application; a child without a
    // known parent is looked up as an unknown bundle, which belongs to the personal persona.
    std::optional<std::string> lookupIdentifier = identifier;
    if (STWContainerClassIsChildData(containerClass)) {
        auto mapping = STWCodeSigningMapping::sharedInstance();
        lookupIdentifier = mapping ? mapping->parentIdentifierForChildIdentifier(identifier) : std::nullopt;
    }
    STWUserIdentitySet identities =
        STWUserIdentitySharedCache::sharedInstance()->userIdentitiesForBundleIdentifier(lookupIdentifier.value_or(""));
    STW_LOG_DEBUG(STWLogCategory::Tolvan, "Chose bundleIdentifier: %@, userIdentities: %@ for identifier: %@, class: %llu",
                  lookupIdentifier ? STWFormatArg(*lookupIdentifier) : STWFormatArg(nullptr), describeSet(identities),
                  identifier, containerClass);
    return _chooseUserIdentity(connection, identities, error, [&] {
        STW_LOG_FN("userIdentityForContainerIdentifier", STWLogLevel::Error, STWLogCategory::Tolvan,
                   "%@ trying to look up persona for %llu:%@", connection.clientBundleIdentifier().value_or("<unknown>"),
                   containerClass, identifier);
    });
}

STWUserIdentityRef STWRequestDecoder::userIdentityForGroupOwner(const STWClientConnection& connection,
                                                                const std::string& owner, uint64_t* error) {
    STWUserIdentityRef caller = callerUserIdentity(connection);
    if (!caller || !caller->isNoSpecificPersona())
        return caller;
    // A plug-in's groups belong to the persona of its application.
    auto mapping = STWCodeSigningMapping::sharedInstance();
    std::string lookupIdentifier = (mapping ? mapping->parentIdentifierForChildIdentifier(owner) : std::nullopt)
                                       .value_or(owner);
    STWUserIdentitySet identities =
        STWUserIdentitySharedCache::sharedInstance()->userIdentitiesForBundleIdentifier(lookupIdentifier);
    STW_LOG_DEBUG(STWLogCategory::Tolvan,
                  "Chose bundleIdentifier: %@ for group container lookup, userIdentities: %@ for identifier: %@",
                  lookupIdentifier, describeSet(identities), owner);
    return _chooseUserIdentity(connection, identities, error, [&] {
        STW_LOG_FN("createOrLookupGroupContainers", STWLogLevel::Error, STWLogCategory::Tolvan,
                   "%@ trying to look up persona for group owner %@",
                   connection.clientBundleIdentifier().value_or("<unknown>"), owner);
    });
}

STWUserIdentityRef STWRequestDecoder::_chooseUserIdentity(const STWClientConnection& connection,
                                                          const STWUserIdentitySet& identities, uint64_t* error,
                                                          const std::function<void()>& logNone) {
    STWUserIdentityRef caller = callerUserIdentity(connection);
    if (identities.size() == 1)
        return *identities.begin();
    if (identities.size() > 1) {
        if (identities.count(caller))
            return caller;
        STW_LOG_FAULT(STWLogCategory::Tolvan, "Ambiguous user identity from [%@]. Expected one of [%@], got %@",
                      connection.clientBundleIdentifier().value_or("<unknown>"), describeSet(identities), caller);
        *error = STWErrorPersonaMismatch;
        return nullptr;
    }
    logNone();
    *error = STWErrorPersonaMismatch;
    return nullptr;
}

STWUserIdentityRef STWRequestDecoder::userIdentityForPersonaUniqueString(
    const STWClientConnection& connection, const std::optional<std::string>& personaUniqueString, uint64_t* error) {
    STWUserIdentityRef caller = callerUserIdentity(connection);
    if (STWPlatformConfiguration::sharedInstance()->isMultiUser())
        return caller;
    STWUserIdentityRef found =
        STWUserIdentitySharedCache::sharedInstance()->userIdentityForCurrentUserWithPersonaUniqueString(
            personaUniqueString);
    std::string client = connection.clientBundleIdentifier().value_or("<unknown>");
    STWFormatArg persona = personaUniqueString ? STWFormatArg(*personaUniqueString) : STWFormatArg(nullptr);
    if (!found) {
        STW_LOG_ERROR(STWLogCategory::Tolvan,
                      "Cannot reconstitute a user identity from provided persona unique string; client = [%@], "
                      "personaUniqueString = [%@]",
                      client, persona);
        *error = STWErrorInvalidClass;
        return nullptr;
    }
    if (caller && (caller->isNoSpecificPersona() || *caller == *found))
        return found;
    STW_LOG_ERROR(STWLogCategory::Tolvan,
                  "Persona unique string is not valid for this client; client = [%@], personaUniqueString = [%@]",
                  client, persona);
    *error = STWErrorPersonaMismatch;
    return nullptr;
}

STWConcreteContainerIdentityRef STWRequestDecoder::concreteIdentityFromKeys(const STWValue::Dictionary& request,
                                                                            const STWClientConnection& connection,
                                                                            const ConcreteKeys& keys,
                                                                            uint64_t* error) {
    const std::string* identifier = STWDictionaryString(request, keys.identifier);
    if (!identifier) {
        *error = STWErrorNoIdentifier;
        return nullptr;
    }
    STWContainerClass containerClass = STWDictionaryUInt64(request, keys.containerClass).value_or(0);
    const STWValue* uuidValue = STWDictionaryFind(request, keys.uuid);
    const STWUUID* uuid = uuidValue ? uuidValue->uuid() : nullptr;
    STWUserIdentityRef userIdentity = callerUserIdentity(connection);
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        const std::string* persona = STWDictionaryString(request, keys.persona);
        userIdentity = userIdentityForPersonaUniqueString(
            connection, persona ? std::optional<std::string>(*persona) : std::nullopt, error);
        if (!userIdentity)
            return nullptr;
    }
    return STWConcreteContainerIdentity::containerIdentityWithUUID(uuid ? *uuid : STWUUID{}, userIdentity,
                                                                   *identifier, containerClass, error);
}

STWContainerIdentityRef STWRequestDecoder::classValidatedIdentity(const STWValue::Dictionary& request,
                                                                  const STWClientConnection& connection,
                                                                  bool callerFallback, uint64_t* error,
                                                                  const char* classKey) {
    std::optional<std::string> identifier;
    if (callerFallback)
        identifier = identifierOrCaller(request, connection);
    else if (const std::string* s = STWDictionaryString(request, "Identifier"))
        identifier = *s;
    STWContainerClass containerClass = STWDictionaryUInt64(request, classKey).value_or(0);
    if (!STWContainerClassIsValid(containerClass)) {
        *error = STWErrorUnexpectedClass;
        return nullptr;
    }
    if (!identifier) {
        *error = STWErrorNoIdentifier;
        return nullptr;
    }
    STWUserIdentityRef userIdentity = userIdentityForContainerIdentifier(connection, containerClass, *identifier, error);
    if (!userIdentity && *error != STWErrorSuccess)
        return nullptr;
    return STWContainerIdentity::containerIdentityWithUserIdentity(userIdentity, *identifier, containerClass, error);
}

void STWRequestDecoder::issueSandboxExtension(STWValue::Dictionary& into, const std::string& key,
                                              const STWMetadata& container, const STWClientConnection& connection) {
    const STWClientIdentityRef& client = connection.clientIdentity();
    if (!client || !client->isSandboxed())
        return;
    bool enterprise = container.userIdentity() && container.userIdentity()->isEnterprise();
    STWContainerClass containerClass = container.containerClass();
    const char* extensionClass = nullptr;
    if (enterprise) {
        if (STWContainerClassTakesContainerExtension(containerClass))
            extensionClass = STWSandboxExtension::containerClass;
        else if (containerClass == STWContainerClassSharedAppGroup)
            extensionClass = STWSandboxExtension::applicationGroupClass;
    }
    const std::string path = container.url().native();
    if (!extensionClass) {
        STW_LOG_INFO(STWLogCategory::Sandbox,
                     "%@ is sandboxed and container (type: %llu) is enterprise: %d. NOT issuing token for path: %s",
                     client, containerClass, enterprise ? 1 : 0, path);
        return;
    }
    STW_LOG_DEFAULT(STWLogCategory::Sandbox,
                    "%@ is sandboxed and container (type: %llu) is enterprise: %d. Issuing token for path: %s", client,
                    containerClass, enterprise ? 1 : 0, path);
    STWErrorRef tokenError;
    auto token =
        STWSandboxExtension::issueFileExtension(extensionClass, path, client->auditToken(), &tokenError);
    if (!token) {
        STW_LOG_ERROR(STWLogCategory::Sandbox, "Failed to issue sandbox extension for %@ at %s: %@", client,
                      path, tokenError);
        return;
    }
    into[key] = STWValue(*token);
}
