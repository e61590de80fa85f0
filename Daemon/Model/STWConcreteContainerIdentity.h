// A container identity that also names one container on disk by the UUID recorded in its
// metadata (not necessarily the UUID of its directory name).
#pragma once

#include "Daemon/Model/STWContainerIdentity.h"

class STWConcreteContainerIdentity;
using STWConcreteContainerIdentityRef = std::shared_ptr<const STWConcreteContainerIdentity>;

class STWConcreteContainerIdentity : public STWContainerIdentity {
public:
    // The base validation, then the UUID (a null UUID is refused with 11).
    static STWConcreteContainerIdentityRef containerIdentityWithUUID(const STWUUID& uuid,
                                                                     const STWUserIdentityRef& userIdentity,
                                                                     const STWValue& identifier,
                                                                     STWContainerClass containerClass, uint64_t* error);
    static STWConcreteContainerIdentityRef containerIdentityWithUUID(const STWUUID& uuid,
                                                                     const STWUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     STWContainerClass containerClass, uint64_t* error);

    static STWConcreteContainerIdentityRef containerIdentityWithUUID(const STWUUID& uuid,
                                                                     const STWUserIdentityRef& userIdentity,
                                                                     const char* identifier,
                                                                     STWContainerClass containerClass, uint64_t* error) {
        return containerIdentityWithUUID(uuid, userIdentity, std::string(identifier), containerClass, error);
    }

    const STWUUID& uuid() const { return _uuid; }
    const STWUUID* uuidIfConcrete() const override { return &_uuid; }

    bool isEqualToConcreteContainerIdentity(const STWConcreteContainerIdentity& other) const;
    bool isEqual(const STWContainerIdentity& other) const override;
    size_t hash() const override;
    std::string description() const override;

private:
    STWConcreteContainerIdentity(STWUUID uuid, STWUserIdentityRef userIdentity, std::string identifier,
                                 STWContainerClass containerClass);
    STWUUID _uuid;
};
