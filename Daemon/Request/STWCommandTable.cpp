#include "Daemon/Request/STWCommandTable.h"

#include "Daemon/Request/STWCommandHandlers.h"

using namespace STWCommandHandlers;

// clang-format off
const std::array<STWCommandTableEntry, STWCommandCount> STWCommandTable = {{
    { 0, createOrLookupContainer,       STWEntitlementAllowed,                1, 1, 1, 0},
    { 1, containersWithClass,           STWEntitlementAllowed,                1, 0, 1, 0},
    { 2, replaceContainer,              STWEntitlementAllowed,                1, 0, 0, 0},
    { 3, stageContainerForDelete,       STWEntitlementAllowed,                1, 0, 0, 0},
    { 4, deleteContainersOnDeathRow,    STWEntitlementUserManagedAssets,      0, 0, 0, 0},
    { 5, setInfoValue,                  STWEntitlementAllowed,                1, 0, 0, 0},
    { 6, infoValueForKey,               STWEntitlementAllowed,                1, 0, 0, 0},
    { 7, containerMetadata,             STWEntitlementAllowed,                1, 0, 0, 0},
    { 8, recreateDefaultStructure,      STWEntitlementAllowed,                1, 0, 0, 0},
    { 9, regenerateDirectoryUUID,       STWEntitlementAllowed,                1, 0, 0, 0},
    {10, deleteContainer,               STWEntitlementAllowed,                1, 0, 0, 0},
    {11, wipeContainer,                 STWEntitlementWipeContainer,          1, 0, 0, 0},
    {12, deleteContainerContent,        STWEntitlementDeleteContainerContent, 1, 0, 0, 0},
    {13, createOrLookupGroupContainers, STWEntitlementAllowed,                1, 1, 1, 0},
    {14, groupContainerIdentifiers,     STWEntitlementAllowed,                1, 0, 1, 0},
    {15, systemContainerPath,           STWEntitlementAllowed,                1, 1, 1, 0},
    {16, systemGroupContainers,         STWEntitlementAllowed,                1, 1, 1, 0},
    {17, systemGroupContainerPath,      STWEntitlementAllowed,                1, 1, 1, 0},
    {18, processCodeSigningInfo,        STWEntitlementAllowed,                1, 0, 0, 0},
    {19, codeSigningInfo,               STWEntitlementAllowed,                1, 0, 0, 0},
    {20, invalidateCodeSigningInfo,     STWEntitlementAllowed,                1, 0, 0, 0},
    {21, setDataProtection,             STWEntitlementAllowed,                0, 0, 0, 0},
    {22, recreateDefaultStructure2,     STWEntitlementAllowed,                1, 0, 0, 0},
    {23, diskUsage,                     STWEntitlementAllowed,                1, 0, 1, 0},
    {24, performDataMigration,          STWEntitlementDataMigration,          1, 0, 0, 0},
    {25, retryTest,                     STWEntitlementTestability,            1, 0, 0, 0},
    {26, stageSharedContent,            STWEntitlementStageSharedContent,     1, 0, 0, 0},
    {27, unsupportedCommand,            STWEntitlementAllowed,                1, 0, 0, 0},
    {28, userManagedAssetsPath,         STWEntitlementUserManagedAssets,      1, 1, 0, 0},
    {29, deleteUserManagedAsset,        STWEntitlementUserManagedAssets,      1, 0, 0, 0},
    {30, performPerUserDataMigration,   STWEntitlementAllowed,                1, 0, 0, 0},
    {31, setTestLock,                   STWEntitlementTestability,            1, 0, 0, 0},
}};
// clang-format on
