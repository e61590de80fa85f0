// Start-up setup and cleanup of the daemon's own connection.
#include "Daemon/Request/STWClientConnection.h"

#include "common/STWLog.h"

// Boot-time setup and cleanup of the container store (restored system containers,
// interrupted replace operations, pending protection changes, leftovers swept to death
// row) are not part of this build yet. These entry points keep the start-up order in
// place; they do no work and claim none.
void STWClientConnection::rebootStowlySetup() {
    STW_LOG_DEBUG(STWLogCategory::Startup, "First-boot setup has no steps in this build");
}

void STWClientConnection::stowlySetup() {
    STW_LOG_DEBUG(STWLogCategory::Startup, "Every-start setup has no steps in this build");
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
