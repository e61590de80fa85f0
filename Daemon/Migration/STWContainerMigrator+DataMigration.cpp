// The migrations clients ask for: the data migration (command 24) and the per-user
// migration (command 30).
#include "Daemon/Migration/STWContainerMigrator.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Request/STWClientConnection.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

namespace fs = std::filesystem;

namespace {

constexpr auto kCategory = STWLogCategory::Lifecycle;

constexpr STWContainerClass kDataClasses[] = {
    STWContainerClassDataApplication, STWContainerClassDataQuilletPlugin, STWContainerClassDataVPNPlugin,
    STWContainerClassSharedAppGroup,  STWContainerClassDataTolvanService, STWContainerClassDataInternalDaemon,
    STWContainerClassDataTempDir};

STWErrorRef exceptionError(const char* function, uint64_t line) {
    return STWErrorForCurrentException(
        function, line, STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage()));
}

} // namespace

bool STWContainerMigrator::performDataMigratorMigrationForClientConnection(STWClientConnection& connection,
                                                                           STWErrorRef* error) {
    try {
        STW_LOG_NOTICE(kCategory, "Performing Data Migration on %@", STWMigrationStatus::currentBuildVersion());
        auto status = STWMigrationStatus::initForSystemMigration();
        STWErrorRef aclError, ownershipError;
        if (!_performACLMigration(*status, &aclError))
            STW_LOG_ERROR(kCategory, "Failed to migrate ACLs on system containers : %@", aclError);
        if (!_performBundleOwnershipMigration(*status, &ownershipError))
            STW_LOG_ERROR(kCategory, "Failed to migrate bundle containers to system location : %@", ownershipError);
        // Group containers that no entry references any more are staged for deletion on the
        // request's command queue, which runs once the reply is decided.
        auto mapping = STWCodeSigningMapping::sharedInstance();
        if (mapping && connection.commandQueue())
            mapping->performAllCodeSigningMigrationAndReconciliationWithCommandQueue(*connection.commandQueue());
        else
            STW_LOG_ERROR(kCategory, "Cannot run the code signing migrations: %s",
                          mapping ? "no command queue" : "no code signing mapping");
        if (aclError || ownershipError) {
            STWSetError(error, aclError ? aclError : ownershipError);
            return false;
        }
        return true;
    } catch (...) {
        STWSetError(error, exceptionError(__func__, __LINE__));
        return false;
    }
}

bool STWContainerMigrator::_performACLMigration(STWMigrationStatus& status, STWErrorRef* error) {
    if (status.hasMigrationOccurredForType(STWMigrationType::acl))
        return true;
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef firstError;
    for (STWContainerClass containerClass : {STWContainerClassDataSystem, STWContainerClassSharedSystemGroup}) {
        auto directory = configuration->globalContainerBaseURLWithContentClass(containerClass, false);
        STWErrorRef walkError;
        if (!directory || !fileManager->itemExistsAtURL(*directory) ||
            fileManager->standardizeAllSystemContainerACLsAtURL(*directory, &walkError))
            continue;
        if (containerClass == STWContainerClassDataSystem)
            STW_LOG_ERROR(kCategory, "Failed to set ACLs on system containers : %@", walkError);
        else
            STW_LOG_ERROR(kCategory, "Failed to set ACLs on system group containers : %@", walkError);
        if (!firstError)
            firstError = walkError;
    }
    if (firstError) {
        // Clients get a daemon code: an ACL walk that failed below the ACL calls is still 63.
        STWSetError(error, firstError->domain() == STWErrorDomain
                               ? firstError
                               : STW_ERROR_NOLOG(STWErrorSetACLFailed, firstError,
                                                 "Failed to set ACLs on system containers"));
        return false;
    }
    status.setMigrationCompleteForType(STWMigrationType::acl);
    return true;
}

bool STWContainerMigrator::_performBundleOwnershipMigration(STWMigrationStatus& status, STWErrorRef* error) {
    if (status.hasMigrationOccurredForType(STWMigrationType::bundle))
        return true;
    STW_LOG_NOTICE(kCategory, "Changing ownership of bundle container content.");
    fs::path bundleDirectory = STWGlobalConfiguration::sharedInstance()->bundleDirectory();
    // Bundles belong to the installer, user and group alike.
    uid_t installer = STWPlatformConfiguration::sharedInstance()->installationUID();
    STWErrorRef walkError;
    if (!STWFileManager::defaultManager()->standardizeOwnershipAtURL(bundleDirectory, installer, installer,
                                                                      &walkError)) {
        STWSetError(error, STW_ERROR(STWErrorChangeOwnerFailed, walkError, "Failed to change owner of %@: %@",
                                     bundleDirectory, walkError));
        return false;
    }
    status.setMigrationCompleteForType(STWMigrationType::bundle);
    return true;
}

bool STWContainerMigrator::performPerUserDataMigrationForClientConnection(STWClientConnection& connection,
                                                                          STWErrorRef* error) {
    try {
        auto caller = connection.clientBundleIdentifier();
        STW_LOG_NOTICE(kCategory, "Container data migration requested by %@ for current mobile user: %u",
                       caller ? STWFormatArg(*caller) : STWFormatArg(nullptr),
                       STWGlobalConfiguration::sharedInstance()->currentMobileUserId());
        auto status = STWMigrationStatus::initForMobileUserMigration();
        if (!status->hasMigrationOccurredForType(STWMigrationType::subdirectory)) {
            _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
                [this](const STWUserIdentityRef& user) { _performSubdirectoryMigrationForUserIdentity(user); });
            status->setMigrationCompleteForType(STWMigrationType::subdirectory);
        }
        _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [this](const STWUserIdentityRef& user) { _performDataProtectionMigrationForUserIdentity(user); });
        return true;
    } catch (...) {
        STWSetError(error, exceptionError(__func__, __LINE__));
        return false;
    }
}

void STWContainerMigrator::_performSubdirectoryMigrationForUserIdentity(const STWUserIdentityRef& userIdentity) {
    std::string build = STWMigrationStatus::currentBuildVersion();
    STW_LOG_NOTICE(kCategory, "Performing Per User Subdirectory Migration for %@ on %@", userIdentity, build);
    auto cache = STWContainerCache::sharedInstance();
    // Each re-creation takes the container's locks itself; nothing is held across it.
    auto connection = STWClientConnection::privilegedClientConnectionWithUserIdentity(userIdentity);
    bool success = true;
    for (STWContainerClass containerClass : kDataClasses) {
        STWErrorRef listError;
        auto containers = cache->allContainersForUserIdentity(userIdentity, containerClass, false, &listError);
        if (!containers) {
            STW_LOG_ERROR(kCategory, "Failed to fetch list of containers for userIdentity: %@, class %ld : %@",
                          userIdentity, containerClass, listError);
            success = false;
            continue;
        }
        for (const STWMetadataRef& container : *containers) {
            uint64_t code = STWErrorSuccess;
            if (!connection->recreateDefaultStructureWithContainerIdentity(container->containerIdentity(), &code) ||
                code != STWErrorSuccess) {
                STW_LOG_ERROR(kCategory, "Failed to recreate container directory structure for %@:%ld:%@ : %llu",
                              container->identifier(), containerClass, container->uuid(), code);
                success = false;
            }
        }
    }
    STW_LOG_NOTICE(kCategory, "Completed Per User Subdirectory Migration for %@ on %@ : Success: %c", userIdentity,
                   build, success ? 'Y' : 'N');
}

void STWContainerMigrator::_performDataProtectionMigrationForUserIdentity(const STWUserIdentityRef& userIdentity) {
    std::string build = STWMigrationStatus::currentBuildVersion();
    STW_LOG_NOTICE(kCategory, "Performing User Data Protection Migration for %@ on %@", userIdentity, build);
    auto cache = STWContainerCache::sharedInstance();
    bool success = true;
    for (STWContainerClass containerClass : kDataClasses) {
        STWErrorRef listError;
        auto containers = cache->allContainersForUserIdentity(userIdentity, containerClass, false, &listError);
        if (!containers) {
            STW_LOG_ERROR(kCategory, "Failed to fetch list of data containers for userIdentity: %@, class: %ld: %@",
                          userIdentity, containerClass, listError);
            success = false;
            continue;
        }
        for (const STWMetadataRef& container : *containers)
            _setDataProtectionIfNecessaryOnContainer(container);
    }
    STW_LOG_NOTICE(kCategory, "Completed User Data Protection Migration for %@ on %@ : Success: %c", userIdentity,
                   build, success ? 'Y' : 'N');
}

void STWContainerMigrator::_setDataProtectionIfNecessaryOnContainer(const STWMetadataRef& container) {
    STWErrorRef lookupError;
    if (_bundleContainerForDataContainer(*container, &lookupError))
        return; // the installation set the class
    if (!lookupError || !lookupError->is(STWErrorNotFound)) {
        STW_LOG_ERROR(kCategory, "Error looking up bundle container for %@ : %@", container->identifier(), lookupError);
        return;
    }
    auto manager = STWDataProtectionManager::defaultManager();
    int32_t protectionClass = manager->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(container->identifier());
    auto identity = container->containerIdentity();
    manager->setDataProtectionOnDataContainerForContainerIdentity(
        identity, protectionClass, false, false, [protectionClass, identity](uint64_t code) {
            if (code != STWErrorSuccess)
                STW_LOG_ERROR(kCategory, "Error setting protection class %d on %@:%llu (%@) : %llu", protectionClass,
                              identity->identifier(), identity->containerClass(), identity->uuid(), code);
        });
}

STWMetadataRef STWContainerMigrator::_bundleContainerForDataContainer(const STWMetadata& container,
                                                                      STWErrorRef* error) {
    std::string identifier = container.identifier();
    if (container.containerClass() == STWContainerClassDataQuilletPlugin) {
        auto mapping = STWCodeSigningMapping::sharedInstance();
        auto parent = mapping ? mapping->parentIdentifierForChildIdentifier(identifier) : std::nullopt;
        if (!parent) {
            STWSetError(error, STW_ERROR(STWErrorNotFound, nullptr, "Parent Container for: \"%@\" Not Found",
                                         identifier));
            return nullptr;
        }
        identifier = *parent;
    } else if (container.containerClass() != STWContainerClassDataApplication) {
        STWSetError(error, STW_ERROR(STWErrorUnexpectedClass, nullptr, "Passed an unexpected container type: %llu",
                                     container.containerClass()));
        return nullptr;
    }
    uint64_t code = STWErrorSuccess;
    auto identity = STWContainerIdentity::containerIdentityWithIdentifier(identifier, STWContainerClassBundleApplication,
                                                                         &code);
    if (!identity) {
        STWSetError(error, STW_ERROR(code, nullptr, "Could not create container identity from [%@]", identifier));
        return nullptr;
    }
    return STWContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false, error);
}
