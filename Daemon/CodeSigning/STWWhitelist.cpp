#include "Daemon/CodeSigning/STWWhitelist.h"

#include "Daemon/Model/STWGlobalConfiguration.h"

namespace {

STWWhitelist::WellknownMapping mappedToThemselves(std::initializer_list<const char*> identifiers) {
    STWWhitelist::WellknownMapping mapping;
    for (const char* identifier : identifiers)
        mapping.emplace(identifier, identifier);
    return mapping;
}

std::optional<std::string> directoryIn(const STWWhitelist::WellknownMapping& mapping,
                                       const std::string& identifier) {
    auto it = mapping.find(identifier);
    if (it == mapping.end())
        return std::nullopt;
    return it->second;
}

std::vector<std::string> keysOf(const STWWhitelist::WellknownMapping& mapping) {
    std::vector<std::string> keys;
    keys.reserve(mapping.size());
    for (const auto& [identifier, directory] : mapping)
        keys.push_back(identifier);
    return keys;
}

} // namespace

STWWhitelistRef STWWhitelist::sharedWhitelist() {
    static const STWWhitelistRef instance =
        configuredWhitelistForInternalImage(STWGlobalConfiguration::sharedInstance()->isInternalImage());
    return instance;
}

STWWhitelistRef STWWhitelist::configuredWhitelistForInternalImage(bool internalImage) {
    WellknownMapping systemContainers = mappedToThemselves({"com.vorlane.maple", "com.vorlane.oak"});
    WellknownMapping systemGroupContainers = mappedToThemselves({
        "systemgroup.com.vorlane.alder",
        "systemgroup.com.vorlane.birch",
        "systemgroup.com.vorlane.cedar",
        "systemgroup.com.vorlane.dogwood",
        "systemgroup.com.vorlane.elm",
        "systemgroup.com.vorlane.fir",
        "systemgroup.com.vorlane.hazel",
        "systemgroup.com.vorlane.juniper",
    });
    if (internalImage)
        systemGroupContainers.emplace("systemgroup.com.vorlane.larch", "systemgroup.com.vorlane.larch");

    ContainerMapping lookupByContainer{
        {STWContainerClassDataInternalDaemon, {"com.vorlane.pine"}},
    };

    CodeSignIdentifierMapping lookupByCodeSignIdentifier{
        {"com.vorlane.quince", std::nullopt},
        {"com.vorlane.rowan",
         ClassRules{{STWContainerClassSharedAppGroup, std::vector<std::string>{"com.vorlane.sumac"}}}},
        {"com.vorlane.tamarack", std::nullopt},
        {"com.vorlane.upas", std::nullopt},
        {"com.vorlane.walnut",
         ClassRules{{STWContainerClassDataApplication, std::vector<std::string>{"com.vorlane.willow"}}}},
        {"com.vorlane.yew", std::nullopt},
        {"com.vorlane.aspen", std::nullopt},
        {"com.vorlane.linden",
         ClassRules{{STWContainerClassDataApplication, std::vector<std::string>{"com.vorlane.poplar"}}}},
        {"com.vorlane.spruce", std::nullopt},
    };

    return initWithSystemContainerMapping(std::move(systemContainers), std::move(systemGroupContainers),
                                          lookupByContainer, lookupByCodeSignIdentifier);
}

STWWhitelistRef STWWhitelist::initWithSystemContainerMapping(
    WellknownMapping systemContainerMapping, WellknownMapping systemGroupContainerMapping,
    const ContainerMapping& whitelistedContainerMapping,
    const CodeSignIdentifierMapping& whitelistedCodeSignIdentifierMapping) {
    std::array<std::optional<IdentifierSet>, STWContainerClassMAX> byContainer;
    // Entries for numbers outside 0 to 13 can never match a lookup and are dropped.
    for (STWContainerClass c = 0; c < STWContainerClassMAX; ++c) {
        auto it = whitelistedContainerMapping.find(c);
        if (it != whitelistedContainerMapping.end())
            byContainer[c] = IdentifierSet(it->second.begin(), it->second.end());
    }
    return std::make_shared<const STWWhitelist>(
        Tag{}, std::move(systemContainerMapping), std::move(systemGroupContainerMapping),
        std::move(byContainer), _convertArraysToSetsInNestedDictionary(whitelistedCodeSignIdentifierMapping));
}

STWWhitelist::STWWhitelist(
    Tag, WellknownMapping systemWhitelist, WellknownMapping systemGroupWhitelist,
    std::array<std::optional<IdentifierSet>, STWContainerClassMAX> whitelistedLookupByContainer,
    LookupRules whitelistedLookupByCodeSignIdentifier)
    : _systemWhitelist(std::move(systemWhitelist)), _systemGroupWhitelist(std::move(systemGroupWhitelist)),
      _whitelistedLookupByContainer(std::move(whitelistedLookupByContainer)),
      _whitelistedLookupByCodeSignIdentifier(std::move(whitelistedLookupByCodeSignIdentifier)) {}

// The rules nest exactly two levels deep (client, then class), so the conversion is two
// loops; "any" markers are kept as they are.
STWWhitelist::LookupRules
STWWhitelist::_convertArraysToSetsInNestedDictionary(const CodeSignIdentifierMapping& mapping) {
    LookupRules rules;
    for (const auto& [codeSignIdentifier, classRules] : mapping) {
        if (!classRules) {
            rules.emplace(codeSignIdentifier, std::nullopt);
            continue;
        }
        ClassSets sets;
        for (const auto& [contentClass, identifiers] : *classRules) {
            if (identifiers)
                sets.emplace(contentClass, IdentifierSet(identifiers->begin(), identifiers->end()));
            else
                sets.emplace(contentClass, std::nullopt);
        }
        rules.emplace(codeSignIdentifier, std::move(sets));
    }
    return rules;
}

std::optional<std::string> STWWhitelist::wellknownSystemContainerForId(const std::string& identifier) const {
    return directoryIn(_systemWhitelist, identifier);
}

std::optional<std::string>
STWWhitelist::wellknownSystemGroupContainerForId(const std::string& identifier) const {
    return directoryIn(_systemGroupWhitelist, identifier);
}

bool STWWhitelist::systemContainerIdIsWellknown(const std::string& identifier) const {
    return _systemWhitelist.contains(identifier);
}

bool STWWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) const {
    return _systemGroupWhitelist.contains(identifier);
}

std::vector<std::string> STWWhitelist::wellknownSystemContainers() const {
    return keysOf(_systemWhitelist);
}

std::vector<std::string> STWWhitelist::wellknownSystemGroupContainers() const {
    return keysOf(_systemGroupWhitelist);
}

bool STWWhitelist::containerIdIsWellknown(const std::string& identifier,
                                          STWContainerClass contentClass) const {
    switch (contentClass) {
    case STWContainerClassDataSystem:
        return systemContainerIdIsWellknown(identifier);
    case STWContainerClassSharedSystemGroup:
        return systemGroupContainerIdIsWellknown(identifier);
    default:
        return false;
    }
}

std::optional<std::string> STWWhitelist::wellknownContainerForId(const std::string& identifier,
                                                                 STWContainerClass contentClass) const {
    switch (contentClass) {
    case STWContainerClassDataSystem:
        return wellknownSystemContainerForId(identifier);
    case STWContainerClassSharedSystemGroup:
        return wellknownSystemGroupContainerForId(identifier);
    default:
        return std::nullopt;
    }
}

bool STWWhitelist::isLookupWhitelistedFromCodeSignIdentifier(const std::string& codeSignIdentifier,
                                                             STWContainerClass forContainerClass,
                                                             const std::string& containerIdentifier) const {
    if (forContainerClass >= STWContainerClassMAX)
        return false;
    const auto& open = _whitelistedLookupByContainer[forContainerClass];
    if (open && open->contains(containerIdentifier))
        return true;
    auto rule = _whitelistedLookupByCodeSignIdentifier.find(codeSignIdentifier);
    if (rule == _whitelistedLookupByCodeSignIdentifier.end())
        return false;
    if (!rule->second)
        return true;
    auto classRule = rule->second->find(forContainerClass);
    if (classRule == rule->second->end())
        return false;
    if (!classRule->second)
        return true;
    return classRule->second->contains(containerIdentifier);
}
