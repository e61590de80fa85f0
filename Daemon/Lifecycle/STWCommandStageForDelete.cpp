#include "Daemon/Lifecycle/STWCommandStageForDelete.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/STWLocks.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"

std::shared_ptr<STWCommandStageForDelete> STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
    std::vector<STWContainerIdentityRef> containerIdentities, bool useLocking, ErrorHandler onError) {
    return std::make_shared<STWCommandStageForDelete>(std::move(containerIdentities), useLocking, std::move(onError));
}

STWCommandStageForDelete::STWCommandStageForDelete(std::vector<STWContainerIdentityRef> containerIdentities,
                                                   bool useLocking, ErrorHandler onError)
    : _containerIdentities(std::move(containerIdentities)), _useLocking(useLocking), _onError(std::move(onError)) {}

bool STWCommandStageForDelete::fromQueue(STWCommandQueue& queue, uint64_t* error) {
    uint64_t pending = STWErrorSuccess;
    bool stopped = false;
    try {
        STWAllIdentifiersLockGuard lock(STWLockMode::Writing, _useLocking);
        auto cache = STWContainerCache::sharedInstance();
        for (const auto& identity : _containerIdentities) {
            STWMetadataRef record;
            if (identity->uuidIfConcrete()) {
                record = cache->containerForContainerIdentity(
                    std::static_pointer_cast<const STWConcreteContainerIdentity>(identity));
            } else {
                STWErrorRef lookupError;
                record = cache->containerForContainerIdentity(identity, false, true, &lookupError);
                if (!record && lookupError)
                    pending = STWDaemonCodeOfError(lookupError, STWErrorCacheRebuildFailed);
            }
            if (!record)
                continue;
            if (STWContainerClassIsBundle(record->containerClass()))
                _removeCodeSigningDictionariesForIdentifierAndItsChildren(record->identifier(), queue);
            // The sandbox's mapping goes before the container does: cut short in between, a
            // start finds a container whose mapping its rebuild pushes again, never a
            // mapping to a container that is gone.
            bool mapped = !record->transient() && cache->shouldRegisterSandboxMappingWithUserIdentity(
                                                      record->userIdentity(), record->identifier(),
                                                      record->containerClass());
            if (mapped)
                cache->setSandboxContainerMappingForUserIdentity(record->userIdentity(), record->identifier(),
                                                                 record->containerClass(), std::nullopt);
            if (!_stageContainer(*record)) {
                if (mapped)
                    cache->setSandboxContainerMappingForUserIdentity(record->userIdentity(), record->identifier(),
                                                                     record->containerClass(), record->url());
                continue;
            }
            STW_CRASH_POINT(STWCrashPoint::deleteAfterStaging);
            STWErrorRef removeError;
            if (!cache->removeContainerForUserIdentity(record->userIdentity(), record->containerClass(),
                                                       record->identifier(), record->transient(), &removeError)) {
                STW_ERROR(STWErrorCacheRemoveFailed, removeError,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d", record->identifier(),
                          record->containerClass(), record->transient() ? 1 : 0);
                pending = STWErrorCacheRemoveFailed;
                stopped = true;
                break;
            }
        }
    } catch (...) {
        STWErrorForCurrentException(__func__, __LINE__, STWExceptionReport::Log);
        pending = STWErrorException;
        stopped = true;
    }
    if (pending != STWErrorSuccess) {
        if (_onError)
            _onError(pending);
        *error = pending;
    }
    return !stopped;
}

bool STWCommandStageForDelete::_stageContainer(const STWMetadata& record) {
    auto fileManager = STWFileManager::defaultManager();
    std::filesystem::path url = record.url();
    std::string name = url.filename();
    std::filesystem::path destination = STWGlobalConfiguration::sharedInstance()->deathrowDirectory() / name;
    // Only the directory that holds the record's own metadata file is moved or removed: the
    // app may have swapped another directory in under the container's name.
    STWErrorRef stepError;
    STWFileDescriptor classfd;
    STWFileDescriptor containerfd = record.openContainerDirectory(&stepError, &classfd);
    if (!containerfd) {
        // Gone, or something else (a link, another directory) in its place: nothing of the
        // container is left there to move.
        if (stepError && (stepError->isPOSIX(ENOENT) || stepError->isPOSIX(ESTALE) || stepError->isPOSIX(ELOOP) ||
                          stepError->isPOSIX(ENOTDIR))) {
            STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Container of %@ is no longer at %@: %@", record.identifier(),
                          url, stepError);
            return true;
        }
        STW_ERROR(STWErrorDeleteFailed, stepError, "Failed to delete container at %@: %@", url, stepError);
        return false;
    }
    auto deathRow = STWGlobalConfiguration::sharedInstance()->openDeathrowDirectory(&stepError);
    if (deathRow && fileManager->moveDirectoryAt(classfd.get(), name, deathRow->fd.get(), name, containerfd.get(),
                                                 STWFileManagerMoveSyncSourceDirectory, url, destination, &stepError))
        return true;
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Couldn't stage for deletion from %@ to %@: %@", url, destination,
                  stepError);
    if (fileManager->removeDirectoryAt(classfd.get(), name, containerfd.get(), url, &stepError))
        return true;
    STW_ERROR(STWErrorDeleteFailed, stepError, "Failed to delete container at %@: %@", url, stepError);
    return false;
}

void STWCommandStageForDelete::_removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                                        STWCommandQueue& queue) {
    if (auto mapping = STWCodeSigningMapping::sharedInstance())
        mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(identifier, queue);
}
