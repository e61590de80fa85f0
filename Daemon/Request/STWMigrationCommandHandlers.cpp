// The handlers of the migration commands: the data migration (24) and the per-user data
// migration (30). The work is the migrator's; a failure answers with its error's code.
#include "Daemon/Request/STWCommandHandlers.h"

#include "Daemon/Migration/STWContainerMigrator.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWError.h"
#include "common/STWLog.h"

namespace STWCommandHandlers {

STW_COMMAND_HANDLER(performDataMigration) {
    (void)request;
    (void)reply;
    STWErrorRef failure;
    if (!STWContainerMigrator::sharedInstance()->performDataMigratorMigrationForClientConnection(connection,
                                                                                               &failure)) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Failed to perform data migration : %@", failure);
        *error = STWDaemonCodeOfError(failure, STWErrorItemOperationFailed);
    }
}

STW_COMMAND_HANDLER(performPerUserDataMigration) {
    (void)request;
    (void)reply;
    STWErrorRef failure;
    if (!STWContainerMigrator::sharedInstance()->performPerUserDataMigrationForClientConnection(connection,
                                                                                              &failure)) {
        STW_LOG_ERROR(STWLogCategory::Tolvan, "Failed to perform per-user data migration : %@", failure);
        *error = STWDaemonCodeOfError(failure, STWErrorItemOperationFailed);
    }
}

} // namespace STWCommandHandlers
