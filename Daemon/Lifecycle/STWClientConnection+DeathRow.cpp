// Death row: what leaves the set of containers is renamed into a fresh "temp." directory of
// death row, and the death-row queue empties it.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWPlatformConfiguration.h"

bool STWClientConnection::_moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                                   bool startDeletionThread, STWErrorRef* error) {
    (void)isDir;
    auto fileManager = STWFileManager::defaultManager();
    auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
    // A deletion pass running meanwhile may remove the fresh, still empty "temp." directory
    // before the item is renamed into it; the rename's ENOENT then means that, not a missing
    // item, and the move is tried again in a new one.
    for (int attempt = 0;; ++attempt) {
        STWErrorRef stepError;
        auto unique = fileManager->createTemporaryDirectoryInDirectoryURL(deathRow, "temp.", &stepError);
        if (!unique) {
            STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError,
                                         "Failed to create unique directory at: %@", deathRow));
            return false;
        }
        STW_CRASH_POINT(STWCrashPoint::deathRowAfterTemporaryDirectory);
        std::filesystem::path destination = *unique / url.filename();
        if (fileManager->moveItemAtURL(url, destination, &stepError))
            break;
        bool missing = stepError && stepError->isPOSIX(ENOENT);
        if (missing && fileManager->itemDoesNotExistAtURL(url))
            return true; // nothing to move; the empty directory goes with the next pass
        if (!missing || attempt == 8) {
            STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError, "Failed to move item at: %@ to: %@",
                                         url, destination));
            return false;
        }
    }
    if (startDeletionThread)
        deleteContainersOnDeathRowWithCompletion(nullptr);
    return true;
}

bool STWClientConnection::_removeItemOrMoveToTempAtURL(const std::filesystem::path& url, STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef removeError;
    if (fileManager->removeItemAtURL(url, &removeError) || (removeError && removeError->isPOSIX(ENOENT)))
        return true;
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
    std::filesystem::path destination =
        STWPlatformConfiguration::sharedInstance()->resolve("/tmp") / url.filename();
    STWErrorRef moveError;
    if (!fileManager->moveItemAtURL(url, destination, &moveError)) {
        STWSetError(error, STW_ERROR(STWErrorMoveDirectoryFailed, moveError, "Failed to move dir: %@ to: %@", url,
                                     destination));
        return false;
    }
    return true;
}

void STWClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion) {
    // The queue holds a transaction for the pass until it ran, so idle exit waits for it.
    STWDaemonQueues::deathRow()->async([completion = std::move(completion)] {
        auto fileManager = STWFileManager::defaultManager();
        auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
        uint64_t result = STWErrorSuccess;
        STWErrorRef listError;
        auto items = fileManager->urlsForItemsInDirectoryAtURL(deathRow, &listError);
        if (!items && !(listError && listError->isPOSIX(ENOENT))) {
            STW_ERROR(STWErrorDeleteFailed, listError, "Failed to get items for deletion: %@ : %@", deathRow,
                      listError);
            result = STWErrorDeleteFailed;
        }
        for (const auto& item : items ? *items : std::vector<std::filesystem::path>{}) {
            STWErrorRef itemError;
            if (!_removeItemOrMoveToTempAtURL(item, &itemError)) {
                STW_ERROR(STWErrorDestroyFailed, itemError, "Failed to destroy item at: %@", item);
                result = STWErrorDestroyFailed;
            }
        }
        if (completion)
            completion(result);
    });
}
