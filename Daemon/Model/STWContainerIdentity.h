// The name of a container: (user identity, identifier, class). Immutable and shared;
// usable as a key of unordered containers through STWContainerIdentityRefHash/Equal.
// STWConcreteContainerIdentity adds the UUID of a container that exists on disk.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "common/STWValue.h"

#include <memory>
#include <string>

class STWContainerIdentity;
using STWContainerIdentityRef = std::shared_ptr<const STWContainerIdentity>;

class STWContainerIdentity {
public:
    // Validates in order: user identity (11), identifier present (18), identifier a
    // string (11), class 1..13 (11). On failure returns nullptr and writes the code
    // through `error` when given.
    static STWContainerIdentityRef containerIdentityWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                     const STWValue& identifier,
                                                                     STWContainerClass containerClass,
                                                                     uint64_t* error);
    static STWContainerIdentityRef containerIdentityWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     STWContainerClass containerClass,
                                                                     uint64_t* error);
    static STWContainerIdentityRef containerIdentityWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                     const char* identifier,
                                                                     STWContainerClass containerClass,
                                                                     uint64_t* error) {
        return containerIdentityWithUserIdentity(userIdentity, std::string(identifier), containerClass, error);
    }
    // For classes that need no user identity: uses the default user identity.
    static STWContainerIdentityRef containerIdentityWithIdentifier(const std::string& identifier,
                                                                   STWContainerClass containerClass, uint64_t* error);

    virtual ~STWContainerIdentity() = default;

    const std::string& identifier() const { return _identifier; }
    STWContainerClass containerClass() const { return _containerClass; }
    const STWUserIdentityRef& userIdentity() const { return _userIdentity; }

    bool isEqualToContainerIdentity(const STWContainerIdentity& other) const;
    // Same object, or, for a plain identity, any identity equal by the base fields; a
    // concrete identity is only equal to concrete identities with the same UUID.
    virtual bool isEqual(const STWContainerIdentity& other) const;
    virtual size_t hash() const;
    virtual std::string description() const;
    virtual const STWUUID* uuidIfConcrete() const { return nullptr; }

protected:
    STWContainerIdentity(STWUserIdentityRef userIdentity, std::string identifier, STWContainerClass containerClass);
    // The shared validation of both kinds of identity: the code of the first failure, or 1.
    static uint64_t _validate(const STWUserIdentityRef& userIdentity, const STWValue& identifier,
                              STWContainerClass containerClass);

    STWUserIdentityRef _userIdentity;
    std::string _identifier;
    STWContainerClass _containerClass;
};

struct STWContainerIdentityRefHash {
    size_t operator()(const STWContainerIdentityRef& c) const { return c ? c->hash() : 0; }
};
struct STWContainerIdentityRefEqual {
    bool operator()(const STWContainerIdentityRef& a, const STWContainerIdentityRef& b) const {
        return a == b || (a && b && a->isEqual(*b));
    }
};
