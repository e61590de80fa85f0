// Start-up setup and cleanup of the daemon's own connection.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "common/STWLog.h"

// Boot-time setup and cleanup of the container store: of their steps, this build has the
// recovery of interrupted replace operations and the restart of pending protection
// changes. Restored system containers and the sweep of leftovers to death row are not part
// of it yet; the entry points keep the start-up order in place and claim no work they do not do.
void STWClientConnection::rebootStowlySetup() {
    STW_LOG_DEBUG(STWLogCategory::Startup, "First-boot setup has no steps in this build");
}

void STWClientConnection::stowlySetup() {
    // Before the first request: a replace cut short by a stop puts its old container back.
    STWErrorRef error;
    if (!_recoverFromReplaceOperationsWithError(&error))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed to recover from replace operations: %@", error);
    // A protection change that a stop cut short, or that was waiting for an unlock, goes on
    // from its update file.
    STWErrorRef protectionError;
    if (!STWDataProtectionManager::defaultManager()->restartPendingDataProtectionOperationsWithError(&protectionError))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed restarting pending data protection operations: %@",
                      protectionError);
}

void STWClientConnection::rebootStowlyCleanupWithCompletion(std::function<void()> completion) {
    STW_LOG_DEBUG(STWLogCategory::Startup, "First-boot cleanup has no steps in this build");
    // With nothing to clean, the cleanup is over as soon as it ran; the completion still
    // marks the boot as seen and tells waiters.
    _backgroundQueue->async(std::move(completion));
}

void STWClientConnection::stowlyCleanupWithCompletion(std::function<void()> completion) {
    STW_LOG_DEBUG(STWLogCategory::Startup, "Every-start cleanup has no steps in this build");
    _backgroundQueue->async(std::move(completion));
}
