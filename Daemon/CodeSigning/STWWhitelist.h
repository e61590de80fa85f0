// The well-known containers and the lookup exceptions.
//
// A few system containers (class 12) and system group containers (class 13) are known by
// name: their directories are named by their identifier instead of a UUID, any client may
// look them up, and a build upgrade leaves them where they are. Separately, a few system
// services may look up particular containers they hold no entitlement for. Both lists are
// fixed tables of the program, built once; the internal build adds one system group.
// The lookup policy, create-or-lookup, the container cache, boot-time setup and the
// migrator ask this object.
#pragma once

#include "Daemon/Model/STWContainerClass.h"

#include <array>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <vector>

class STWWhitelist;
using STWWhitelistRef = std::shared_ptr<const STWWhitelist>;

class STWWhitelist {
public:
    // Identifier -> directory name.
    using WellknownMapping = std::map<std::string, std::string, std::less<>>;
    // Class -> identifiers every client may look up.
    using ContainerMapping = std::map<STWContainerClass, std::vector<std::string>>;
    // Per class: nullopt for any container of the class, else these identifiers.
    using ClassRules = std::map<STWContainerClass, std::optional<std::vector<std::string>>>;
    // Client code-signing identifier -> nullopt for any container, else its class rules.
    using CodeSignIdentifierMapping = std::map<std::string, std::optional<ClassRules>, std::less<>>;

    static STWWhitelistRef sharedWhitelist();
    // The configured tables, with or without the internal build's additions.
    static STWWhitelistRef configuredWhitelistForInternalImage(bool internalImage);

    static STWWhitelistRef
    initWithSystemContainerMapping(WellknownMapping systemContainerMapping,
                                   WellknownMapping systemGroupContainerMapping,
                                   const ContainerMapping& whitelistedContainerMapping,
                                   const CodeSignIdentifierMapping& whitelistedCodeSignIdentifierMapping);

    // The directory name of a well-known container, nullopt when it is not well known.
    std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) const;
    std::optional<std::string> wellknownSystemGroupContainerForId(const std::string& identifier) const;
    bool systemContainerIdIsWellknown(const std::string& identifier) const;
    bool systemGroupContainerIdIsWellknown(const std::string& identifier) const;
    std::vector<std::string> wellknownSystemContainers() const;
    std::vector<std::string> wellknownSystemGroupContainers() const;
    // Classes 12 and 13 ask their list; every other class is never well known.
    bool containerIdIsWellknown(const std::string& identifier, STWContainerClass contentClass) const;
    std::optional<std::string> wellknownContainerForId(const std::string& identifier,
                                                       STWContainerClass contentClass) const;

    // Whether a client signed as `codeSignIdentifier` may look up the container
    // (`contentClass`, `containerIdentifier`) without an entitlement for it.
    bool isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                   STWContainerClass forContainerClass,
                                                   const std::string& containerIdentifier) const;

private:
    using IdentifierSet = std::set<std::string, std::less<>>;
    using ClassSets = std::map<STWContainerClass, std::optional<IdentifierSet>>;
    using LookupRules = std::map<std::string, std::optional<ClassSets>, std::less<>>;

    struct Tag {};

public:
    STWWhitelist(Tag, WellknownMapping systemWhitelist, WellknownMapping systemGroupWhitelist,
                 std::array<std::optional<IdentifierSet>, STWContainerClassMAX> whitelistedLookupByContainer,
                 LookupRules whitelistedLookupByCodeSignIdentifier);

private:
    static LookupRules _convertArraysToSetsInNestedDictionary(const CodeSignIdentifierMapping& mapping);

    const WellknownMapping _systemWhitelist;
    const WellknownMapping _systemGroupWhitelist;
    // Indexed by class 0 to 13.
    const std::array<std::optional<IdentifierSet>, STWContainerClassMAX> _whitelistedLookupByContainer;
    const LookupRules _whitelistedLookupByCodeSignIdentifier;
};
