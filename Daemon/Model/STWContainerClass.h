// Container classes: the kinds of container the daemon manages and every rule that
// depends on the kind. Each rule is one function of the class number, shared by all
// subsystems, so a class set is written down in exactly one place.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>

using STWContainerClass = uint64_t;

enum : STWContainerClass {
    STWContainerClassUndefined = 0,
    STWContainerClassBundleApplication = 1,
    STWContainerClassDataApplication = 2,
    STWContainerClassBundleQuilletPlugin = 3,
    STWContainerClassDataQuilletPlugin = 4,
    STWContainerClassBundleVPNPlugin = 5,
    STWContainerClassDataVPNPlugin = 6,
    STWContainerClassSharedAppGroup = 7,
    STWContainerClassBundleFramework = 8,
    STWContainerClassDataTolvanService = 9,
    STWContainerClassDataInternalDaemon = 10,
    STWContainerClassDataTempDir = 11,
    STWContainerClassDataSystem = 12,
    STWContainerClassSharedSystemGroup = 13,
    STWContainerClassMAX = 14,
};

// Per-user classes in the order the daemon iterates them.
inline constexpr STWContainerClass STWPerUserContainerClasses[] = {2, 4, 6, 7, 9, 10, 11};

bool STWContainerClassIsValid(STWContainerClass c);                // 1..13
bool STWContainerClassIsBundle(STWContainerClass c);               // {1, 3, 5, 8}
bool STWContainerClassIsSystem(STWContainerClass c);               // {12, 13}
bool STWContainerClassIsGlobal(STWContainerClass c);               // bundle and system classes
bool STWContainerClassIsPerUser(STWContainerClass c);              // {2, 4, 6, 7, 9, 10, 11}
bool STWContainerClassIsChildData(STWContainerClass c);            // {4, 6}
bool STWContainerClassIsGroup(STWContainerClass c);                // {7, 13}
// Data classes whose enterprise containers are handed out with a container extension.
bool STWContainerClassTakesContainerExtension(STWContainerClass c); // {2, 4, 6, 10}
// Data classes whose sandbox mapping is pushed only for the user identities entitled to
// the bundle: {2, 4, 6, 9, 10, 11}.
bool STWContainerClassRegistersOnlyForEntitledUsers(STWContainerClass c);
// The data class that goes with a bundle class: 1 -> 2, 3 -> 4, 5 -> 6; 0 for every other
// class (a framework has no data container).
STWContainerClass STWContainerClassDataClassForBundleClass(STWContainerClass c);

// "Data/Application" and so on; "Undefined" and "MAX" for the end markers, empty beyond.
std::string_view STWContainerClassDirectoryName(STWContainerClass c);
// The key of the lookup entitlement for the class ("appData"); empty for 0 and 14 on.
std::string_view STWContainerClassLookupWord(STWContainerClass c);
// Item type of the class's sandbox mappings; nullopt for classes never mapped.
std::optional<uint32_t> STWContainerClassSandboxItemType(STWContainerClass c);
