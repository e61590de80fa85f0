// The decoding rules the command handlers share: how "Identifier", "ContainerClass",
// "UUID" and a persona unique string become a container identity with the right user
// identity, and how a sandbox token is added to a reply. Each rule reports failure with
// a code through `error` (which the caller set to 1) and returns nothing.
#pragma once

#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWValue.h"

#include <functional>
#include <optional>
#include <string>

class STWClientConnection;

class STWRequestDecoder {
public:
    // The string under `key`, or the caller's bundle identifier when the key is absent.
    static std::optional<std::string> identifierOrCaller(const STWValue::Dictionary& request,
                                                         const STWClientConnection& connection,
                                                         const char* key = "Identifier");

    // The user identity whose container of (`containerClass`, `identifier`) the caller
    // means: its own, unless it acts for no specific persona and the class is per-user,
    // in which case the persona the identifier belongs to (76 when none or ambiguous).
    static STWUserIdentityRef userIdentityForContainerIdentifier(const STWClientConnection& connection,
                                                                 STWContainerClass containerClass,
                                                                 const std::string& identifier, uint64_t* error);

    // The user identity whose group containers of `owner` the caller means: as above, with
    // a plug-in's groups belonging to the persona of its application.
    static STWUserIdentityRef userIdentityForGroupOwner(const STWClientConnection& connection, const std::string& owner,
                                                        uint64_t* error);

    // The user identity a persona unique string names, as long as the caller may act for
    // it (76 when it is someone else's, 11 when there is none).
    static STWUserIdentityRef userIdentityForPersonaUniqueString(const STWClientConnection& connection,
                                                                 const std::optional<std::string>& personaUniqueString,
                                                                 uint64_t* error);

    struct ConcreteKeys {
        const char* identifier = "Identifier";
        const char* containerClass = "ContainerClass";
        const char* uuid = "UUID";
        const char* persona = "PersonaUniqueString";
    };
    // A concrete identity from the named keys; the identifier is required (18).
    static STWConcreteContainerIdentityRef concreteIdentityFromKeys(const STWValue::Dictionary& request,
                                                                    const STWClientConnection& connection,
                                                                    const ConcreteKeys& keys, uint64_t* error);

    // An identity whose class must be 1 to 13 (20); the identifier comes from `identifierKey`,
    // or with `callerFallback` from the caller when the key is absent (18 when neither).
    static STWContainerIdentityRef classValidatedIdentity(const STWValue::Dictionary& request,
                                                          const STWClientConnection& connection,
                                                          bool callerFallback, uint64_t* error,
                                                          const char* classKey = "ContainerClass");

    // Adds a sandbox token for the container's path under `key` when the caller is
    // sandboxed and the container belongs to an enterprise persona.
    static void issueSandboxExtension(STWValue::Dictionary& into, const std::string& key, const STWMetadata& container,
                                      const STWClientConnection& connection);

private:
    // The only identity of `identities`, or the caller's own among several; 76 otherwise,
    // after `logNone` when there is none at all.
    static STWUserIdentityRef _chooseUserIdentity(const STWClientConnection& connection,
                                                  const STWUserIdentitySet& identities, uint64_t* error,
                                                  const std::function<void()>& logNone);
};
