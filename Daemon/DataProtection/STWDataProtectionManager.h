// The data-protection manager: which protection class a data container's items get. It
// derives the class a new container starts with from its identifier's entitlements, and
// changes the class of a live container (STWDataProtectionChangeOperation): the change is
// persisted as an update file before it touches anything, waits for the next unlock when the
// device is locked and the caller allows it, and is finished by the next start when a stop
// cut it short. The class applied is recorded in the container's metadata info under
// STWMetadata::contentProtectionClassInfoKey.
//
// Used by the request that sets a container's class, create-or-lookup (a new container's
// class) and the every-start setup. Thread-safe: update files are only touched on
// protectionOperationFileQueue(); changes run on the caller's thread, reruns on the
// lock-state queue.
#pragma once

#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "common/STWError.h"
#include "platform/STWQueue.h"

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

class STWDataProtectionManager {
public:
    STWDataProtectionManager();
    static const std::shared_ptr<STWDataProtectionManager>& defaultManager();

    // "com.vorlane.Stowly.ProtectionOperationFileQueue": every read, write and removal of an
    // update file.
    const std::shared_ptr<STWQueue>& protectionOperationFileQueue() const { return _protectionOperationFileQueue; }

    // Changes the class of the data container of `identity` (classes 2, 4, 6, 7, 9, 10, 11).
    // `completion` gets 1 or the error code exactly once: at once, or, when the device is
    // locked and `retryIfLocked` is set, after the rerun that follows the next unlock.
    // Class 2 is refused, and applications not part of the system get only 0, 1 and 3.
    void setDataProtectionOnDataContainerForContainerIdentity(const STWContainerIdentityRef& identity,
                                                              int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
                                                              bool retryIfLocked,
                                                              std::function<void(uint64_t code)> completion);
    // Starts the change of every update file a stop left behind, without completion.
    bool restartPendingDataProtectionOperationsWithError(STWErrorRef* error);

    // The first string among the entitlements "com.vorlane.developer.default-data-protection",
    // "data-protection-class" and "DataProtectionClass" as a class number; 0 when there is
    // none or it names no known protection type.
    int32_t intendedDataProtectionClassBasedOnEntitlementsForIdentifier(const std::string& identifier);

    // Runs `operation` now on the calling thread. Before its first rerun the application is
    // stopped (an STWApplicationTerminationAssertion held until the change ends); on success
    // the class is recorded before the update file goes.
    void _startDataProtectionChangeOperation(const std::shared_ptr<STWDataProtectionChangeOperation>& operation,
                                             std::function<void(uint64_t code)> completion);

private:
    std::shared_ptr<STWQueue> _protectionOperationFileQueue;
};
