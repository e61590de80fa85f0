// The handlers of the command table, one per command, named after it. Each decodes its
// keys, calls the client connection's operation and writes its reply keys.
#pragma once

#include "Daemon/Request/STWCommandTable.h"

namespace STWCommandHandlers {

#define STW_COMMAND_HANDLER(name)                                                                            \
    void name(const STWValue::Dictionary& request, const STWReplyRef& reply, STWClientConnection& connection,   \
              uint64_t* error)

STW_COMMAND_HANDLER(createOrLookupContainer);
STW_COMMAND_HANDLER(containersWithClass);
STW_COMMAND_HANDLER(replaceContainer);
STW_COMMAND_HANDLER(stageContainerForDelete);
STW_COMMAND_HANDLER(deleteContainersOnDeathRow);
STW_COMMAND_HANDLER(setInfoValue);
STW_COMMAND_HANDLER(infoValueForKey);
STW_COMMAND_HANDLER(containerMetadata);
STW_COMMAND_HANDLER(recreateDefaultStructure);
STW_COMMAND_HANDLER(regenerateDirectoryUUID);
STW_COMMAND_HANDLER(deleteContainer);
STW_COMMAND_HANDLER(wipeContainer);
STW_COMMAND_HANDLER(deleteContainerContent);
STW_COMMAND_HANDLER(createOrLookupGroupContainers);
STW_COMMAND_HANDLER(groupContainerIdentifiers);
STW_COMMAND_HANDLER(systemContainerPath);
STW_COMMAND_HANDLER(systemGroupContainers);
STW_COMMAND_HANDLER(systemGroupContainerPath);
STW_COMMAND_HANDLER(processCodeSigningInfo);
STW_COMMAND_HANDLER(codeSigningInfo);
STW_COMMAND_HANDLER(invalidateCodeSigningInfo);
STW_COMMAND_HANDLER(setDataProtection);
STW_COMMAND_HANDLER(recreateDefaultStructure2);
STW_COMMAND_HANDLER(diskUsage);
STW_COMMAND_HANDLER(performDataMigration);
STW_COMMAND_HANDLER(retryTest);
STW_COMMAND_HANDLER(stageSharedContent);
STW_COMMAND_HANDLER(unsupportedCommand);
STW_COMMAND_HANDLER(userManagedAssetsPath);
STW_COMMAND_HANDLER(deleteUserManagedAsset);
STW_COMMAND_HANDLER(performPerUserDataMigration);
STW_COMMAND_HANDLER(setTestLock);

} // namespace STWCommandHandlers
