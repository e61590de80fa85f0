#include "Daemon/Model/STWConcreteContainerIdentity.h"

#include "common/STWError.h"
#include "common/STWLog.h"

STWConcreteContainerIdentity::STWConcreteContainerIdentity(STWUUID uuid, STWUserIdentityRef userIdentity,
                                                           std::string identifier, STWContainerClass containerClass)
    : STWContainerIdentity(std::move(userIdentity), std::move(identifier), containerClass), _uuid(uuid) {}

STWConcreteContainerIdentityRef STWConcreteContainerIdentity::containerIdentityWithUUID(
    const STWUUID& uuid, const STWUserIdentityRef& userIdentity, const STWValue& identifier,
    STWContainerClass containerClass, uint64_t* error) {
    // Every UUID is one, the all-zero one included.
    uint64_t code = _validate(userIdentity, identifier, containerClass);
    if (code != STWErrorSuccess) {
        if (error)
            *error = code;
        return nullptr;
    }
    return STWConcreteContainerIdentityRef(
        new STWConcreteContainerIdentity(uuid, userIdentity, *identifier.string(), containerClass));
}

STWConcreteContainerIdentityRef STWConcreteContainerIdentity::containerIdentityWithUUID(
    const STWUUID& uuid, const STWUserIdentityRef& userIdentity, const std::string& identifier,
    STWContainerClass containerClass, uint64_t* error) {
    return containerIdentityWithUUID(uuid, userIdentity, STWValue(identifier), containerClass, error);
}

bool STWConcreteContainerIdentity::isEqualToConcreteContainerIdentity(const STWConcreteContainerIdentity& other) const {
    return _uuid == other._uuid && isEqualToContainerIdentity(other);
}

bool STWConcreteContainerIdentity::isEqual(const STWContainerIdentity& other) const {
    if (this == &other)
        return true;
    const STWUUID* otherUUID = other.uuidIfConcrete();
    return otherUUID && *otherUUID == _uuid && isEqualToContainerIdentity(other);
}

size_t STWConcreteContainerIdentity::hash() const {
    return STWContainerIdentity::hash() ^ std::hash<STWUUID>()(_uuid);
}

std::string STWConcreteContainerIdentity::description() const {
    return STWFormat("<%@: %p; userIdentity = %@, identifier = %@, class = %llu, uuid = %@>",
                     "STWConcreteContainerIdentity", static_cast<const void*>(this), _userIdentity->shortDescription(),
                     _identifier, _containerClass, _uuid);
}
