#include "Daemon/Model/STWUserIdentity.h"
#include "platform/STWUserDatabase.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

namespace {

const char* valueClassName(const STWValue* v) {
    if (!v)
        return "(null)";
    switch (v->type()) {
    case STWValue::Type::Null:
        return "null";
    case STWValue::Type::Bool:
        return "boolean";
    case STWValue::Type::Integer:
    case STWValue::Type::Real:
        return "number";
    case STWValue::Type::String:
        return "string";
    case STWValue::Type::Data:
        return "data";
    case STWValue::Type::Date:
        return "date";
    case STWValue::Type::UUID:
        return "UUID";
    case STWValue::Type::Array:
        return "array";
    case STWValue::Type::Dictionary:
        break;
    }
    return "dictionary";
}

// A number field of a stored identity; logs and sets 75 when it is missing or not a number.
std::optional<uint64_t> storedNumber(const STWValue::Dictionary& plist, const char* key, uint64_t* error) {
    const STWValue* v = STWDictionaryFind(plist, key);
    if (v && v->isNumber()) {
        if (auto u = v->uint64Value())
            return u;
        if (auto r = v->realValue(); r && *r >= 0 && *r <= 4294967295.0)
            return static_cast<uint64_t>(*r);
    }
    STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid user identity plist data. Expected number for %@, got %@. Data: %@",
                  key, valueClassName(v), STWValue(plist));
    if (error)
        *error = STWErrorMalformedUserIdentity;
    return std::nullopt;
}

} // namespace

STWUserIdentity::STWUserIdentity(uid_t uid, gid_t gid, std::filesystem::path homeDirectoryURL,
                                 std::optional<std::string> personaUniqueString, uint32_t personaType,
                                 uint32_t kernelPersonaID)
    : _homeDirectoryURL(std::move(homeDirectoryURL)), _kernelPersonaID(kernelPersonaID), _posixUID(uid),
      _posixGID(gid), _personaType(personaType), _personaUniqueString(std::move(personaUniqueString)) {
    _identifier = (_personaType == STWPersonaTypeEnterprise && _personaUniqueString) ? *_personaUniqueString
                                                                                   : std::to_string(_posixUID);
}

STWUserIdentityRef STWUserIdentity::initWithUID(uid_t uid, gid_t gid, const std::filesystem::path& homeDirectoryURL,
                                                std::optional<std::string> personaUniqueString, uint32_t personaType,
                                                uint32_t kernelPersonaID) {
    if (homeDirectoryURL.empty())
        STW_LOG_FAULT(STWLogCategory::Unspecified, "Home directory cannot be nil");
    if (uid < 501) {
        STW_LOG_ERROR(STWLogCategory::Unspecified,
                      "Attempt to create a STWUserIdentity object with a role user uid is not allowed: uid = %u, gid = %u",
                      uid, gid);
        return nullptr;
    }
    return std::make_shared<const STWUserIdentity>(uid, gid, homeDirectoryURL, std::move(personaUniqueString),
                                                   personaType, kernelPersonaID);
}

STWUserIdentityRef STWUserIdentity::init() {
    return initWithUID(501, 501, STWUserDatabase::homeDirectoryURLForPOSIXUID(501), std::nullopt, STWPersonaTypePersonal,
                       501);
}

STWUserIdentityRef STWUserIdentity::copyWithUID(uid_t uid, gid_t gid) const {
    std::filesystem::path home = isEnterprise() ? _homeDirectoryURL : STWUserDatabase::homeDirectoryURLForPOSIXUID(uid);
    return initWithUID(uid, gid, home, _personaUniqueString, _personaType, _kernelPersonaID);
}

STWUserIdentityRef STWUserIdentity::userIdentityWithPlist(const STWValue& plist, STWUserIdentityCache& cache,
                                                          uint64_t* error) {
    const STWValue::Dictionary* dictionary = plist.dictionary();
    const std::string* version = dictionary ? STWDictionaryString(*dictionary, "version") : nullptr;
    if (!version || (*version != "1" && *version != "2")) {
        // Not a stored identity at all: malformed as far as the readers are concerned.
        if (error)
            *error = STWErrorMalformedUserIdentity;
        return nullptr;
    }
    auto uid = storedNumber(*dictionary, "posixUID", error);
    if (!uid)
        return nullptr;
    auto gid = storedNumber(*dictionary, "posixGID", error);
    if (!gid)
        return nullptr;
    if (*version == "1") {
        if (const std::string* persona = STWDictionaryString(*dictionary, "personaIdentifier"))
            if (auto identity = cache.userIdentityForPersonaUniqueString(*persona, *uid, *gid))
                return identity;
        return cache.userIdentityForPersonalPersonaWithUID(*uid, *gid);
    }
    auto type = storedNumber(*dictionary, "type", error);
    if (!type)
        return nullptr;
    if (*type >= 3) {
        STW_LOG_ERROR(STWLogCategory::Unspecified,
                      "Invalid user identity plist data. Expected persona type for %@, got %@. Data: %@", "type",
                      *type, plist);
        if (error)
            *error = STWErrorMalformedUserIdentity;
        return nullptr;
    }
    const std::string* unique = STWDictionaryString(*dictionary, "personaUniqueString");
    if (unique && *type == STWPersonaTypeEnterprise) {
        STWUserIdentityRef identity = cache.userIdentityForPersonaUniqueString(*unique, *uid, *gid);
        if (identity && !identity->isEnterprise())
            STW_LOG_ERROR(STWLogCategory::Unspecified,
                          "Invalid user identity plist data. Expected %@ to be enterprise, but it was not. Data: %@",
                          identity, plist);
        return identity;
    }
    return cache.userIdentityForPersonalPersonaWithUID(*uid, *gid);
}

STWValue::Dictionary STWUserIdentity::plist() const {
    STWValue::Dictionary d{
        {"posixUID", STWValue(_posixUID)},
        {"posixGID", STWValue(_posixGID)},
        {"type", STWValue(_personaType)},
        {"version", STWValue("2")},
    };
    if (_personaUniqueString)
        d["personaUniqueString"] = STWValue(*_personaUniqueString);
    return d;
}

bool STWUserIdentity::isUserIdentityRequiredForContainerClass(STWContainerClass containerClass) {
    return !STWContainerClassIsBundle(containerClass) && !STWContainerClassIsSystem(containerClass);
}

uid_t STWUserIdentity::posixUIDForContainerClass(STWContainerClass containerClass) const {
    if (STWContainerClassIsBundle(containerClass))
        return STWPlatformConfiguration::sharedInstance()->installationUID();
    if (STWContainerClassIsSystem(containerClass))
        return STWPlatformConfiguration::sharedInstance()->systemContainerUID();
    return _posixUID;
}

gid_t STWUserIdentity::posixGIDForContainerClass(STWContainerClass containerClass) const {
    if (STWContainerClassIsBundle(containerClass))
        return STWPlatformConfiguration::sharedInstance()->installationUID();
    if (STWContainerClassIsSystem(containerClass))
        return STWPlatformConfiguration::sharedInstance()->systemContainerUID();
    return _posixGID;
}

const char* STWUserIdentity::personaTypeName(uint32_t type) {
    switch (type) {
    case STWPersonaTypePersonal:
        return "personal";
    case STWPersonaTypeEnterprise:
        return "enterprise";
    case STWPersonaTypeUnspecific:
        return "unspecific";
    default:
        return "unknown";
    }
}

std::string STWUserIdentity::description() const {
    return STWFormat("<%@: %p; posixUID = %u, posixGID = %u, identifier = %@, homeDirectoryURL = %@, personaType = %@, "
                     "personaUniqueString = %@, kernelPersonaID = %d>",
                     "STWUserIdentity", static_cast<const void*>(this), _posixUID, _posixGID, _identifier,
                     _homeDirectoryURL, personaTypeName(_personaType),
                     _personaUniqueString ? STWFormatArg(*_personaUniqueString) : STWFormatArg(nullptr),
                     _kernelPersonaID);
}

std::string STWUserIdentity::shortDescription() const {
    return STWFormat("<%@: %p; %u/%u/%@/%d/%d>", "STWUserIdentity", static_cast<const void*>(this), _posixUID,
                     _posixGID, _identifier, _personaType, _kernelPersonaID);
}
