// Start-up setup and cleanup of the daemon's own connection: what a stop left behind is
// repaired before the first request (setup) or swept into death row while requests are
// served (cleanup).
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWGroupManager.h"
#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/Lifecycle/STWBuildUpgrade.h"
#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/STWLocks.h"
#include "common/STWLog.h"
#include "platform/STWTransaction.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>

namespace fs = std::filesystem;

namespace {

constexpr STWContainerClass kPerUserClasses[] = {
    STWContainerClassDataApplication, STWContainerClassDataQuilletPlugin, STWContainerClassDataVPNPlugin,
    STWContainerClassSharedAppGroup,  STWContainerClassDataTolvanService, STWContainerClassDataInternalDaemon,
    STWContainerClassDataTempDir};
constexpr STWContainerClass kGlobalClasses[] = {
    STWContainerClassBundleApplication, STWContainerClassBundleQuilletPlugin,
    STWContainerClassBundleVPNPlugin,   STWContainerClassBundleFramework,
    STWContainerClassDataSystem,        STWContainerClassSharedSystemGroup};

// Its own system group container keeps its path across upgrades: the telemetry it holds
// is read by path from before the upgrade.
constexpr const char* kTelemetryGroupIdentifier = "systemgroup.com.vorlane.telemetry";

} // namespace

// MARK: - Setup

void STWClientConnection::stowlySetup() {
    // Before the first request: a replace cut short by a stop puts its old container back.
    STWErrorRef error;
    if (!_recoverFromReplaceOperationsWithError(&error))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed recovering from replace operations: %@", error);
    // A protection change that a stop cut short, or that was waiting for an unlock, goes on
    // from its update file.
    STWErrorRef protectionError;
    if (!STWDataProtectionManager::defaultManager()->restartPendingDataProtectionOperationsWithError(
            &protectionError))
        STW_LOG_ERROR(STWLogCategory::Startup, "Failed restarting pending data protection operations: %@",
                      protectionError);
    // Application groups that no stored entry names any more leave. A code-signing update
    // stores its entry before it sends the groups it dropped to death row, so a stop in
    // between leaves them for this sweep. Before the first request, so that no entry can
    // name a group again while it goes; the commands take the daemon-wide lock themselves,
    // so the queue runs after it is released.
    auto commandQueue = STWCommandQueue::init();
    {
        STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
        STWGroupManager::defaultManager()->reconcileGroupContainersOfType(STWGroupTypeApplication, *commandQueue);
    }
    uint64_t code = STWErrorSuccess;
    commandQueue->executeAllUntilExhaustedOrError(&code);
}

void STWClientConnection::rebootStowlySetup() {
    if (auto upgrade = STWBuildUpgrade::installed()) {
        if (upgrade->isBuildUpgrade()) {
            _regenerateAllSystemContainerPaths();
            STWErrorRef error;
            if (!upgrade->performSynchronousBuildUpgradeMigration(&error))
                STW_LOG_ERROR(STWLogCategory::Startup, "Failed to perform build upgrade migration : %@",
                              error);
            upgrade->writeCurrentBuildInfoToDisk();
        }
    } else {
        STW_LOG_DEBUG(STWLogCategory::Startup,
                      "No build-upgrade migration is built: this start is no upgrade");
    }

    _moveSystemContainersIntoPlace();
}

// MARK: - Cleanup

std::shared_ptr<const STWClientConnection::DirectoryListing>
STWClientConnection::_listDirectoryForCleanup(const fs::path& url, const fs::path& trustedAncestor,
                                              STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    auto listing = std::make_shared<DirectoryListing>();
    listing->url = url;
    listing->fd =
        std::make_shared<STWFileDescriptor>(fileManager->openDirectoryAtURL(url, trustedAncestor, error));
    if (!*listing->fd)
        return nullptr;
    auto items = fileManager->itemsInDirectoryAt(listing->fd->get(), url, error);
    if (!items)
        return nullptr;
    listing->items = std::move(*items);
    return listing;
}

void STWClientConnection::_cleanupOrphanedDataForDirectories(const DirectoryListing& directories,
                                                             STWContainerClass containerClass) {
    auto cache = STWContainerCache::sharedInstance();
    auto fileManager = STWFileManager::defaultManager();
    bool internal = STWGlobalConfiguration::sharedInstance()->isInternalImage();
    int classfd = directories.fd->get();
    std::string metadataPath;
    // The names of one directory are unique: its garbage shares one directory in death row.
    DeathRowBatch batch;
    for (const auto& entry : directories.items) {
        struct stat st;
        bool containerName = cache->containerURL(fs::path(entry.name), containerClass);
        if (entry.isDirectory && containerName) {
            // The common case, a container, costs one stat. Should the app have put a link
            // in its place since the listing, the stat may follow it, and at worst the link
            // stays until the next sweep: nothing is moved on what this call says.
            metadataPath.assign(entry.name).append("/").append(STWContainerMetadataFileName);
            if (fstatat(classfd, metadataPath.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 || errno != ENOENT)
                continue;
        }
        // Held, never opened: a link or a FIFO an app planted is moved as the entry it is.
        STWFileDescriptor item(openat(classfd, entry.name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
        if (!item || fstat(item.get(), &st) != 0)
            continue; // gone meanwhile
        fs::path url = directories.url / entry.name;
        bool isDirectory = S_ISDIR(st.st_mode);
        if (isDirectory && containerName) {
            // Decided again on the directory just opened, not on a path an app could redirect.
            struct stat metadata;
            if (fstatat(item.get(), STWContainerMetadataFileName, &metadata, AT_SYMLINK_NOFOLLOW) == 0 ||
                errno != ENOENT)
                continue;
            STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Deleting orphaned data missing a metadata file at: %@",
                           url);
        }
        if (internal) {
            STW_LOG_ERROR(
                STWLogCategory::Lifecycle,
                "===== A process wrote data that is no container into %@: please file a problem report "
                "naming the process that writes invalid data into container directories =====",
                directories.url);
            if (isDirectory)
                fileManager->printDirectoryStructureAtURL(url);
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "===== End of invalid data at %@ =====", url);
        }
        // Garbage that may as well come back after a power cut: the next start sweeps it again.
        STWErrorRef error;
        _moveItemAtToDeathRow(classfd, entry.name, item.get(), url, &error, STWFileManagerMoveDefault, &batch);
    }
}

void STWClientConnection::_cleanupOprhanedCodeSigningMappingData() {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    STWErrorRef error;
    if (mapping && !mapping->removeAllAdvanceCopiesWithError(&error))
        STW_LOG_ERROR(STWLogCategory::Startup, "Could not remove advance copies of code sign data: %@",
                      error);
}

void STWClientConnection::rebootStowlyCleanupWithCompletion(std::function<void()> completion) {
    STWTransaction::begin();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    // Transient containers never survive a reboot. Their directories go now, before the
    // first request, and under the lock that every creation holds: a transient container
    // made by a request once serving began must not be swept with them.
    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    auto sentence = [this](const fs::path& url, const char* failure) {
        STWErrorRef error;
        if (!_moveItemAtURLToDeathRow(url, true, false, &error, STWFileManagerMoveDefault))
            STW_LOG_ERROR(STWLogCategory::Startup, failure, url, error);
    };
    sentence(configuration->transientDirectory(), "Failed to delete shared transient URL %@ : %@");
    if (auto legacy = configuration->legacyTransientBundleDirectory()) {
        STW_LOG_NOTICE(STWLogCategory::Startup,
                       "Sentencing legacy transient bundle directory [%@] to final deletion", *legacy);
        sentence(*legacy, "Failed to delete legacy shared transient bundle URL %@ : %@");
    }
    sentence(configuration->transientBundleDirectory(),
             "Failed to delete shared transient bundle URL %@ : %@");

    // Each class directory is listed here, once, and swept on the background queue.
    auto sweep = [this](const STWUserIdentityRef& user, STWContainerClass containerClass) {
        auto directory = STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(
            user, containerClass, false);
        if (!directory)
            return;
        STWErrorRef listError;
        auto listing = _listDirectoryForCleanup(*directory, STWTrustedAncestorForClass(user, containerClass),
                                                &listError);
        if (!listing) {
            if (!listError || !listError->isPOSIX(ENOENT))
                STW_LOG_ERROR(STWLogCategory::Startup, "Failed to get items : %@", listError);
            return;
        }
        _backgroundQueue->async([this, listing, containerClass] {
            _cleanupOrphanedDataForDirectories(*listing, containerClass);
        });
    };
    _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
        [&](const STWUserIdentityRef& user) {
            auto perUser = configuration->getPerUserConfigurationForUserIdentity(user);
            if (!perUser)
                return;
            sentence(perUser->transientDirectory(), "Failed to delete per-user transient URL %@ : %@");
            for (STWContainerClass containerClass : kPerUserClasses)
                sweep(user, containerClass);
        });
    for (STWContainerClass containerClass : kGlobalClasses)
        sweep(STWUserIdentityCache::defaultUserIdentity(), containerClass);
    _backgroundQueue->async([this] { _cleanupOprhanedCodeSigningMappingData(); });
    // The queue is serial: this runs after every sweep above.
    _backgroundQueue->async([completion = std::move(completion)] {
        if (completion)
            completion();
        STWTransaction::end();
    });
}

void STWClientConnection::stowlyCleanupWithCompletion(std::function<void(uint64_t)> completion) {
    STWTransaction::begin();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    std::vector<std::shared_ptr<const DirectoryListing>> leftovers;
    {
        // A creation holds this lock from its staging directory to its publication (an
        // upcall may be making one already): what is listed under it is left over.
        STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
        STWErrorRef error;
        if (auto listing = _listDirectoryForCleanup(configuration->stagingDirectory(), {}, &error))
            leftovers.push_back(std::move(listing));
        else if (!error || !error->isPOSIX(ENOENT))
            STW_LOG_ERROR(STWLogCategory::Startup, "Failed to get items at global staging URL: %@ : %@",
                          configuration->stagingDirectory(), error);
        _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(
            [&](const STWUserIdentityRef& user) {
                fs::path staging =
                    configuration->stagingDirectoryURLForUserIdentity(user, STWContainerClassDataApplication);
                STWErrorRef userError;
                auto listing = _listDirectoryForCleanup(
                    staging, STWTrustedAncestorForClass(user, STWContainerClassDataApplication), &userError);
                if (listing)
                    leftovers.push_back(std::move(listing));
                else if (!userError || !userError->isPOSIX(ENOENT))
                    STW_LOG_ERROR(STWLogCategory::Startup,
                                  "Failed to get items at per-user staging URL: %@ : %@", staging, userError);
            });
    }
    _backgroundQueue->async([this, leftovers = std::move(leftovers), completion = std::move(completion)] {
        for (const auto& listing : leftovers) {
            // Gone before the pass below starts, which then takes the batch's directory too.
            DeathRowBatch batch;
            for (const auto& entry : listing->items) {
                STWFileDescriptor item(
                    openat(listing->fd->get(), entry.name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
                STWErrorRef error;
                if (item)
                    _moveItemAtToDeathRow(listing->fd->get(), entry.name, item.get(),
                                          listing->url / entry.name, &error, STWFileManagerMoveDefault, &batch);
            }
        }
        deleteContainersOnDeathRowWithCompletion([completion](uint64_t code) {
            if (completion)
                completion(code);
            STWTransaction::end();
        });
    });
}

// MARK: - Build upgrade

void STWClientConnection::_regenerateAllSystemContainerPaths() {
    STW_LOG_NOTICE(STWLogCategory::Startup, "Rolling system container directory UUIDs on disk");
    auto whitelist = STWWhitelist::sharedWhitelist();
    STWUserIdentityRef userIdentity = _clientIdentity ? _clientIdentity->userIdentity() : nullptr;
    for (STWContainerClass containerClass :
         {STWContainerClassDataSystem, STWContainerClassSharedSystemGroup}) {
        STWErrorRef error;
        auto containers = STWContainerCache::sharedInstance()->allContainersForUserIdentity(
            userIdentity, containerClass, false, false, &error);
        if (!containers) {
            STW_LOG_ERROR(STWLogCategory::Startup,
                          "Failed to get list of system containers for migration: %@", error);
            continue;
        }
        for (const auto& container : *containers) {
            const std::string& identifier = container->identifier();
            if (whitelist->containerIdIsWellknown(identifier, containerClass) ||
                identifier == kTelemetryGroupIdentifier)
                continue;
            uint64_t code = STWErrorSuccess;
            if (!regenerateDirectoryUUIDWithContainerIdentity(container->containerIdentity(), &code))
                STW_LOG_ERROR(STWLogCategory::Startup,
                              "Failed to regenerate directory UUID for identifier: %@, class: %llu",
                              identifier, containerClass);
        }
    }
}
