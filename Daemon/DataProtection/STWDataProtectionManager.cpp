#include "Daemon/DataProtection/STWDataProtectionManager.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWApplicationTerminationAssertion.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

STWDataProtectionManager::STWDataProtectionManager()
    : _protectionOperationFileQueue(STWQueue::create("com.vorlane.Stowly.ProtectionOperationFileQueue")) {}

const std::shared_ptr<STWDataProtectionManager>& STWDataProtectionManager::defaultManager() {
    static const std::shared_ptr<STWDataProtectionManager> manager = std::make_shared<STWDataProtectionManager>();
    return manager;
}

void STWDataProtectionManager::setDataProtectionOnDataContainerForContainerIdentity(
    const STWContainerIdentityRef& identity, int32_t dataProtectionClass, bool isSecondOrThirdPartyApp,
    bool retryIfLocked, std::function<void(uint64_t code)> completion) {
    auto complete = [&](uint64_t code) {
        if (completion)
            completion(code);
    };
    static constexpr std::array<STWContainerClass, 7> dataClasses{2, 4, 6, 7, 9, 10, 11};
    if (!identity || std::find(dataClasses.begin(), dataClasses.end(), identity->containerClass()) == dataClasses.end()) {
        STW_ERROR(STWErrorInvalidClass, nullptr, "Can't act on an invalid object: identity: %@", identity);
        return complete(STWErrorInvalidClass);
    }
    STWErrorRef lookupError;
    STWMetadataRef metadata =
        STWContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, true, &lookupError);
    if (!metadata) {
        STW_ERROR(STWErrorNotFound, lookupError, "No Container with identity: %@", identity);
        return complete(STWErrorNotFound);
    }
    int32_t current = 0;
    if (const auto& info = metadata->info()) {
        const STWValue* value = STWDictionaryFind(*info, STWMetadata::contentProtectionClassInfoKey);
        if (auto number = value ? value->truncatedInt64Value() : std::nullopt)
            current = static_cast<int32_t>(*number);
    }
    if (dataProtectionClass == current) {
        // Nothing to walk; a change still waiting for an unlock is no longer wanted.
        STWErrorRef deleteError;
        bool deleted = _protectionOperationFileQueue->syncResult([&] {
            return STWDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(
                *metadata->containerIdentity(), &deleteError);
        });
        if (!deleted)
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to delete existing data protection update file: %@",
                          deleteError);
        return complete(deleted ? STWErrorSuccess : STWDaemonCodeOfError(deleteError, STWErrorRemovePendingFileFailed));
    }
    if (dataProtectionClass == 2) {
        STW_ERROR(STWErrorInvalidArgument, nullptr, "Data protection class %d is not allowed", dataProtectionClass);
        return complete(STWErrorInvalidArgument);
    }
    if (isSecondOrThirdPartyApp && dataProtectionClass != 0 && dataProtectionClass != 1 && dataProtectionClass != 3) {
        STW_ERROR(STWErrorInvalidArgument, nullptr, "Data protection class %d is invalid for 2nd and 3rd party apps",
                  dataProtectionClass);
        return complete(STWErrorInvalidArgument);
    }
    // Toward a stronger class the files follow (never weakened); toward a weaker one only the
    // directories change, and files made from then on inherit it.
    int32_t changeType = dataProtectionClass < current || (current == 0 && dataProtectionClass < 3)
                             ? STWDataProtectionChangeDirectories | STWDataProtectionChangeFiles |
                                   STWDataProtectionChangeOnlyStronger
                             : STWDataProtectionChangeDirectories;
    auto operation = STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
        metadata, dataProtectionClass, retryIfLocked, changeType, _protectionOperationFileQueue);
    STWErrorRef writeError;
    if (!operation->writeToDiskWithError(&writeError)) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to write data protection update file to disk: %@", writeError);
        return complete(STWDaemonCodeOfError(writeError, STWErrorWriteFileFailed));
    }
    STW_CRASH_POINT(STWCrashPoint::protectionAfterUpdateFile);
    _startDataProtectionChangeOperation(operation, std::move(completion));
}

void STWDataProtectionManager::_startDataProtectionChangeOperation(
    const std::shared_ptr<STWDataProtectionChangeOperation>& operation, std::function<void(uint64_t code)> completion) {
    // The operation keeps these callbacks, so they hold it weakly.
    std::weak_ptr<STWDataProtectionChangeOperation> weak = operation;
    auto assertion = std::make_shared<std::shared_ptr<STWApplicationTerminationAssertion>>();
    operation->setRetryStartBlock([weak, assertion] {
        // The application must not run while the rerun changes its files.
        if (auto op = weak.lock())
            *assertion = STWApplicationTerminationAssertion::initWithBundleIdentifier(
                op->dataContainerMetadata()->identifier(), 0);
    });
    operation->setRecordClassBlock([weak] {
        auto op = weak.lock();
        if (!op)
            return;
        const auto& metadata = op->dataContainerMetadata();
        uint64_t code = STWErrorSuccess;
        if (!STWClientConnection::privilegedClientConnectionWithUserIdentity(metadata->userIdentity())
                 ->setInfoValue(STWValue(op->newDataProtectionClass()),
                                STWValue(STWMetadata::contentProtectionClassInfoKey), metadata->containerIdentity(),
                                true, &code))
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to set protection class info for %@ at %@ to %d : %llu",
                          metadata->identifier(), metadata->url(), op->newDataProtectionClass(), code);
    });
    operation->setCompletionBlock([weak, assertion, completion = std::move(completion)](bool wasLocked,
                                                                                         const STWErrorRef& error) {
        auto op = weak.lock();
        uint64_t code = STWErrorSuccess;
        if (error) {
            code = STWDaemonCodeOfError(error, STWErrorInvalidArgument);
            if (op)
                STW_LOG_ERROR(STWLogCategory::Lifecycle,
                              "Failed to set data protection on container with identifier %@ at %@ to %d: %@",
                              op->dataContainerMetadata()->identifier(), op->dataContainerMetadata()->url(),
                              op->newDataProtectionClass(), error);
        }
        if (wasLocked && op && op->retryIfLocked())
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Unexpectedly got completion block called with wasLocked");
        if (*assertion) {
            (*assertion)->invalidate();
            assertion->reset();
        }
        if (completion)
            completion(code);
    });
    operation->performChangeOperation();
}

bool STWDataProtectionManager::restartPendingDataProtectionOperationsWithError(STWErrorRef* error) {
    std::filesystem::path directory = STWGlobalConfiguration::sharedInstance()->pendingUpdatesDirectory();
    // An update file cut short while it was being written: its change never began.
    if (int removed = STWRemoveAbandonedAtomicWrites(directory); removed > 0)
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Removed %d unfinished update files in %@", removed, directory);
    STWErrorRef listError;
    auto files = STWFileManager::defaultManager()->urlsForItemsInDirectoryAtURL(directory, &listError);
    if (!files) {
        if (listError && listError->isPOSIX(ENOENT))
            return true;
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to get items at pendingUpdates URL %@ : %@", directory,
                      listError);
        STWSetError(error, std::move(listError));
        return false;
    }
    for (const auto& file : *files) {
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Found pending data protection operation at %@", file);
        STWErrorRef readError;
        auto operation = STWDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(
            file, _protectionOperationFileQueue, &readError);
        if (!operation) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to read data protection change operation at %@ : %@", file,
                          readError);
            // Its container was deleted after the change failed to remove its file: the
            // change would only find nothing and remove the file, so remove it now. A file
            // that could not be read, or a lookup that failed otherwise, stays for next time.
            if (readError && readError->code() == STWErrorNotFound && readError->underlyingError() &&
                readError->underlyingError()->code() == STWErrorNotFound) {
                STWErrorRef removeError;
                if (STWFileManager::defaultManager()->removeItemAtURL(file, &removeError))
                    STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Removed update file of a missing container at %@", file);
                else
                    STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to remove data protection file at %@ : %@", file,
                                  removeError);
            }
            continue;
        }
        const auto& metadata = operation->dataContainerMetadata();
        STW_LOG_NOTICE(STWLogCategory::Lifecycle,
                       "Starting pending data protection update to protection class %d for user: %@, ID: %@, "
                       "containerClass: %llu",
                       operation->newDataProtectionClass(), metadata->userIdentity(), metadata->identifier(),
                       metadata->containerClass());
        _startDataProtectionChangeOperation(operation, nullptr);
    }
    return true;
}

int32_t STWDataProtectionManager::intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
    const std::string& identifier) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    auto entitlements = mapping ? mapping->entitlementsForIdentifier(identifier) : std::nullopt;
    if (!entitlements)
        return 0;
    const std::string* name = nullptr;
    for (const char* key : {"com.vorlane.developer.default-data-protection", "data-protection-class",
                            "DataProtectionClass"})
        if ((name = STWDictionaryString(*entitlements, key)))
            break;
    if (!name)
        return 0;
    // The protection-type names an app's entitlements use on this platform.
    static constexpr std::array<std::pair<std::string_view, int32_t>, 6> types{{
        {"complete", 1},
        {"complete-unless-open", 2},
        {"complete-until-first-user-authentication", 3},
        {"none", 4},
        {"write-only", 2},
        {"complete-until-user-authentication", 3},
    }};
    for (const auto& [type, protectionClass] : types)
        if (*name == type)
            return protectionClass;
    STW_LOG_ERROR(STWLogCategory::Lifecycle, "Unknown value for DataProtectionClass entitlement: %@; defaulting to class %d",
                  *name, 0);
    return 0;
}
