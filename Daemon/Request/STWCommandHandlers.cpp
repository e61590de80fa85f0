#include "Daemon/Request/STWCommandHandlers.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWError.h"
#include "common/STWLog.h"

namespace STWCommandHandlers {

namespace {

// The operation behind a command that this build does not carry yet: the caller gets
// "unsupported", never a pretended success.
void _operationNotInThisBuild(const char* command, uint64_t* error) {
    STW_LOG_DEBUG(STWLogCategory::Tolvan, "%s: the operation is not part of this build", command);
    *error = STWErrorUnsupportedCommand;
}

} // namespace

#define STW_COMMAND_NOT_IN_THIS_BUILD(name)                                                                  \
    STW_COMMAND_HANDLER(name) {                                                                              \
        (void)request;                                                                                       \
        (void)reply;                                                                                         \
        (void)connection;                                                                                    \
        _operationNotInThisBuild(#name, error);                                                              \
    }

STW_COMMAND_NOT_IN_THIS_BUILD(createOrLookupContainer)
STW_COMMAND_NOT_IN_THIS_BUILD(containersWithClass)
STW_COMMAND_NOT_IN_THIS_BUILD(replaceContainer)
STW_COMMAND_NOT_IN_THIS_BUILD(stageContainerForDelete)
STW_COMMAND_NOT_IN_THIS_BUILD(deleteContainersOnDeathRow)
STW_COMMAND_NOT_IN_THIS_BUILD(setInfoValue)
STW_COMMAND_NOT_IN_THIS_BUILD(infoValueForKey)
STW_COMMAND_NOT_IN_THIS_BUILD(containerMetadata)
STW_COMMAND_NOT_IN_THIS_BUILD(recreateDefaultStructure)
STW_COMMAND_NOT_IN_THIS_BUILD(regenerateDirectoryUUID)
STW_COMMAND_NOT_IN_THIS_BUILD(deleteContainer)
STW_COMMAND_NOT_IN_THIS_BUILD(wipeContainer)
STW_COMMAND_NOT_IN_THIS_BUILD(deleteContainerContent)
STW_COMMAND_NOT_IN_THIS_BUILD(createOrLookupGroupContainers)
STW_COMMAND_NOT_IN_THIS_BUILD(groupContainerIdentifiers)
STW_COMMAND_NOT_IN_THIS_BUILD(systemContainerPath)
STW_COMMAND_NOT_IN_THIS_BUILD(systemGroupContainers)
STW_COMMAND_NOT_IN_THIS_BUILD(systemGroupContainerPath)
STW_COMMAND_NOT_IN_THIS_BUILD(processCodeSigningInfo)
STW_COMMAND_NOT_IN_THIS_BUILD(codeSigningInfo)
STW_COMMAND_NOT_IN_THIS_BUILD(invalidateCodeSigningInfo)
STW_COMMAND_NOT_IN_THIS_BUILD(setDataProtection)
STW_COMMAND_NOT_IN_THIS_BUILD(recreateDefaultStructure2)
STW_COMMAND_NOT_IN_THIS_BUILD(diskUsage)
STW_COMMAND_NOT_IN_THIS_BUILD(performDataMigration)
STW_COMMAND_NOT_IN_THIS_BUILD(stageSharedContent)
STW_COMMAND_NOT_IN_THIS_BUILD(userManagedAssetsPath)
STW_COMMAND_NOT_IN_THIS_BUILD(deleteUserManagedAsset)
STW_COMMAND_NOT_IN_THIS_BUILD(performPerUserDataMigration)

STW_COMMAND_HANDLER(retryTest) {
    (void)reply;
    (void)connection;
    if (!STWGlobalConfiguration::sharedInstance()->isInternalImage()) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "People really shouldn't be calling this on non-internal installs!");
        return;
    }
    (void)request;
    _operationNotInThisBuild("retryTest", error);
}

STW_COMMAND_HANDLER(unsupportedCommand) {
    (void)request;
    (void)reply;
    (void)connection;
    *error = STWErrorUnsupportedCommand;
}

STW_COMMAND_HANDLER(setTestLock) {
    (void)reply;
    (void)connection;
    if (!STWGlobalConfiguration::sharedInstance()->isInternalImage()) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Unsupported call to set lock!");
        return;
    }
    (void)request;
    _operationNotInThisBuild("setTestLock", error);
}

} // namespace STWCommandHandlers
