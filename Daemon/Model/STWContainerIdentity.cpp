#include "Daemon/Model/STWContainerIdentity.h"

#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"
#include "common/STWLog.h"

STWContainerIdentity::STWContainerIdentity(STWUserIdentityRef userIdentity, std::string identifier,
                                           STWContainerClass containerClass)
    : _userIdentity(std::move(userIdentity)), _identifier(std::move(identifier)), _containerClass(containerClass) {}

uint64_t STWContainerIdentity::_validate(const STWUserIdentityRef& userIdentity, const STWValue& identifier,
                                         STWContainerClass containerClass) {
    if (!userIdentity) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid object: no user identity");
        return STWErrorInvalidClass;
    }
    if (identifier.isNull()) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid object: missing identifier");
        return STWErrorNoIdentifier;
    }
    if (!identifier.string()) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid object: identifier = [%@]", identifier);
        return STWErrorInvalidClass;
    }
    if (!STWContainerClassIsValid(containerClass)) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid object: container class = %llu", containerClass);
        return STWErrorInvalidClass;
    }
    return STWErrorSuccess;
}

STWContainerIdentityRef STWContainerIdentity::containerIdentityWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                                const STWValue& identifier,
                                                                                STWContainerClass containerClass,
                                                                                uint64_t* error) {
    uint64_t code = _validate(userIdentity, identifier, containerClass);
    if (code != STWErrorSuccess) {
        if (error)
            *error = code;
        return nullptr;
    }
    return STWContainerIdentityRef(new STWContainerIdentity(userIdentity, *identifier.string(), containerClass));
}

STWContainerIdentityRef STWContainerIdentity::containerIdentityWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                                const std::string& identifier,
                                                                                STWContainerClass containerClass,
                                                                                uint64_t* error) {
    // A string is an identifier already; the value form checks (and logs) the rest.
    if (!userIdentity || !STWContainerClassIsValid(containerClass))
        return containerIdentityWithUserIdentity(userIdentity, STWValue(identifier), containerClass, error);
    return STWContainerIdentityRef(new STWContainerIdentity(userIdentity, identifier, containerClass));
}

STWContainerIdentityRef STWContainerIdentity::containerIdentityWithIdentifier(const std::string& identifier,
                                                                              STWContainerClass containerClass,
                                                                              uint64_t* error) {
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        STW_LOG_FAULT(STWLogCategory::Unspecified,
                      "Attempt to create a container identity without a user identity when one is required; identifier "
                      "= [%@], class = %llu",
                      identifier, containerClass);
        if (error)
            *error = STWErrorInvalidClass;
        return nullptr;
    }
    return containerIdentityWithUserIdentity(STWUserIdentityCache::defaultUserIdentity(), identifier, containerClass,
                                             error);
}

bool STWContainerIdentity::isEqualToContainerIdentity(const STWContainerIdentity& other) const {
    return _identifier == other._identifier && *_userIdentity == *other._userIdentity &&
           _containerClass == other._containerClass;
}

bool STWContainerIdentity::isEqual(const STWContainerIdentity& other) const {
    return this == &other || isEqualToContainerIdentity(other);
}

size_t STWContainerIdentity::hash() const {
    return std::hash<std::string>()(_identifier) ^ _userIdentity->hash() ^ static_cast<size_t>(_containerClass);
}

std::string STWContainerIdentity::description() const {
    return STWFormat("<%@: %p; userIdentity = %@, identifier = %@, class = %llu>", "STWContainerIdentity",
                     static_cast<const void*>(this), _userIdentity->shortDescription(), _identifier, _containerClass);
}
