// Whose container a container is: a POSIX user acting under one persona (personal,
// enterprise, or no specific persona). Immutable; equality and hash use `identifier`, so
// the personal and the unspecific identity of one user are equal, and enterprise
// identities are told apart by their persona unique strings.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "common/STWValue.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <sys/types.h>

class STWUserIdentity;
class STWUserIdentityCache;
using STWUserIdentityRef = std::shared_ptr<const STWUserIdentity>;

enum : uint32_t {
    STWPersonaTypePersonal = 0,
    STWPersonaTypeEnterprise = 1,
    STWPersonaTypeUnspecific = 2,
};

class STWUserIdentity {
public:
    // nullptr (with a log) for a role user below 501.
    static STWUserIdentityRef initWithUID(uid_t uid, gid_t gid, const std::filesystem::path& homeDirectoryURL,
                                          std::optional<std::string> personaUniqueString, uint32_t personaType,
                                          uint32_t kernelPersonaID);
    // The legacy mobile user: 501/501 with the home of user 501, personal, persona id 501.
    static STWUserIdentityRef init();

    // Reads a stored form (version 1 or 2). nullptr when there is none; `error` (set to 1
    // by the caller) becomes 75 for malformed data and stays 1 when the cache had no
    // identity for well-formed data.
    static STWUserIdentityRef userIdentityWithPlist(const STWValue& plist, STWUserIdentityCache& cache,
                                                    uint64_t* error);
    // The version-2 stored form.
    STWValue::Dictionary plist() const;

    static bool isUserIdentityRequiredForContainerClass(STWContainerClass containerClass);
    // Owner of the containers of a class that belong to this identity.
    uid_t posixUIDForContainerClass(STWContainerClass containerClass) const;
    gid_t posixGIDForContainerClass(STWContainerClass containerClass) const;

    const std::filesystem::path& homeDirectoryURL() const { return _homeDirectoryURL; }
    uint32_t kernelPersonaID() const { return _kernelPersonaID; }
    uid_t posixUID() const { return _posixUID; }
    gid_t posixGID() const { return _posixGID; }
    uint32_t personaType() const { return _personaType; }
    const std::optional<std::string>& personaUniqueString() const { return _personaUniqueString; }
    const std::string& identifier() const { return _identifier; }

    bool isEnterprise() const { return _personaType == STWPersonaTypeEnterprise; }
    bool isNoSpecificPersona() const { return _personaType == STWPersonaTypeUnspecific; }
    bool isHomeDirectoryInCommonSandbox() const {
        return _personaType == STWPersonaTypePersonal || _personaType == STWPersonaTypeUnspecific;
    }

    // A copy with other ids and, unless enterprise, the home directory of the new user.
    STWUserIdentityRef copyWithUID(uid_t uid, gid_t gid) const;

    bool operator==(const STWUserIdentity& other) const { return _identifier == other._identifier; }
    size_t hash() const { return std::hash<std::string>()(_identifier); }
    std::string description() const;
    std::string shortDescription() const;
    static const char* personaTypeName(uint32_t type);

    STWUserIdentity(uid_t uid, gid_t gid, std::filesystem::path homeDirectoryURL,
                    std::optional<std::string> personaUniqueString, uint32_t personaType, uint32_t kernelPersonaID);

private:
    std::filesystem::path _homeDirectoryURL;
    uint32_t _kernelPersonaID;
    uid_t _posixUID;
    gid_t _posixGID;
    uint32_t _personaType;
    std::optional<std::string> _personaUniqueString;
    std::string _identifier;
};

// Hash and equality of identities held by pointer, for unordered containers.
struct STWUserIdentityRefHash {
    size_t operator()(const STWUserIdentityRef& u) const { return u ? u->hash() : 0; }
};
struct STWUserIdentityRefEqual {
    bool operator()(const STWUserIdentityRef& a, const STWUserIdentityRef& b) const {
        return a == b || (a && b && *a == *b);
    }
};
