// The migrator's instance, the build-upgrade seam and the build-upgrade migration.
#include "Daemon/Migration/STWContainerMigrator.h"

#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWBuildUpgrade.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWPerUserConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/STWLocks.h"
#include "common/STWException.h"
#include "common/STWFormat.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>
#include <mutex>
#include <sys/stat.h>
#include <unistd.h>

namespace fs = std::filesystem;

namespace {

constexpr auto kCategory = STWLogCategory::Lifecycle;

// Where an older release kept bundle containers: inside the mobile user's home.
constexpr const char* kLegacyBundleDirectory = "/private/var/mobile/Containers/Bundle";

constexpr STWContainerClass kSystemClasses[] = {STWContainerClassDataSystem, STWContainerClassSharedSystemGroup};

// The seam the first-boot setup calls. The system store is read once, when the setup asks
// whether this start is an upgrade, and the same object records the build afterwards.
class BuildUpgrade final : public STWBuildUpgrade {
public:
    bool isBuildUpgrade() override { return status()->isBuildUpgrade(); }
    bool performSynchronousBuildUpgradeMigration(STWErrorRef* error) override {
        return STWContainerMigrator::sharedInstance()->performSynchronousBuildUpgradeMigration(*status(), error);
    }
    void writeCurrentBuildInfoToDisk() override { status()->writeCurrentBuildInfoToDisk(); }

private:
    std::shared_ptr<STWMigrationStatus> status() {
        std::call_once(_made, [this] { _status = STWMigrationStatus::initForSystemMigration(); });
        return _status;
    }
    std::once_flag _made;
    std::shared_ptr<STWMigrationStatus> _status;
};

// The integer at the start of a path extension ("3" of ".3"), 0 when there is none, as an
// older daemon read the extensions of its rotated logs.
long long extensionNumber(const fs::path& name) {
    std::string extension = name.extension().string();
    return extension.empty() ? 0 : std::strtoll(extension.c_str() + 1, nullptr, 10);
}

// Removes the directory `name` of `parentfd` when it holds nothing but empty directories
// (the layout start-up made in its place); ENOTEMPTY when it holds anything else.
bool removeEmptyLayoutDirectory(int parentfd, const std::string& name, const fs::path& path, STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef openError;
    STWFileDescriptor directory =
        fileManager->openBeneath(parentfd, name, O_RDONLY | O_DIRECTORY, 0, STWOpenBeneathNoSymlinks, &openError);
    if (!directory)
        return openError && openError->isPOSIX(ENOENT) ? true : (STWSetError(error, openError), false);
    auto items = fileManager->itemsInDirectoryAt(directory.get(), path, error);
    if (!items)
        return false;
    for (const auto& item : *items)
        if (unlinkat(directory.get(), item.name.c_str(), AT_REMOVEDIR) != 0) {
            int e = errno;
            STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot remove %@: %s", path / item.name, strerror(e)));
            return false;
        }
    if (unlinkat(parentfd, name.c_str(), AT_REMOVEDIR) != 0) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot remove %@: %s", path, strerror(e)));
        return false;
    }
    return true;
}

} // namespace

const std::shared_ptr<STWContainerMigrator>& STWContainerMigrator::sharedInstance() {
    static const auto instance = std::make_shared<STWContainerMigrator>(STWUserIdentitySharedCache::sharedInstance());
    return instance;
}

STWContainerMigrator::STWContainerMigrator(std::shared_ptr<STWUserIdentityCache> userIdentityCache)
    : _userIdentityCache(std::move(userIdentityCache)) {}

void STWContainerMigrator::installBuildUpgrade() { STWBuildUpgrade::install(std::make_shared<BuildUpgrade>()); }

void STWContainerMigrator::logRecordedMigrations() {
    auto info = STWMigrationStatus::readMigrationInfo(STWGlobalConfiguration::sharedInstance()->libraryDirectory() /
                                                      STWMigrationStatus::systemFileName);
    if (!info)
        return; // logged by the read
    std::string build = "none", types;
    for (const auto& [key, value] : *info) {
        if (key == STWMigrationStatus::lastBuildInfoKey) {
            const STWValue::Dictionary* last = value.dictionary();
            const std::string* version = last ? STWDictionaryString(*last, "BuildVersion") : nullptr;
            build = version ? *version : "unknown";
        } else {
            types += (types.empty() ? "" : ", ") + key;
        }
    }
    STW_LOG_NOTICE(STWLogCategory::Startup, "Last build recorded: %@; migrations recorded: %@", build,
                   types.empty() ? std::string("none") : types);
}

bool STWContainerMigrator::performSynchronousBuildUpgradeMigration(STWMigrationStatus& status, STWErrorRef* error) {
    try {
        if (!STWPlatformConfiguration::sharedInstance()->isMultiUser())
            _migrateOldLogFiles();
        STWErrorRef stepError;
        if (!_moveLegacyBundleDirectoryWithError(&stepError)) {
            STW_LOG_ERROR(kCategory, "Failed to migrate to new bundle containers location : %@.  This is terrible.",
                          stepError);
            STWSetError(error, stepError);
            return false;
        }
        _checkIfDeviceMayNeedSystemContainerACLMigration(status);
        if (!_performWhitelistMigrationWithError(&stepError)) {
            STW_LOG_ERROR(kCategory, "Failed to migrate whitelisted bundle containers : %@", stepError);
            STWSetError(error, stepError);
            return false;
        }
        return true;
    } catch (...) {
        STWSetError(error, STWErrorForCurrentException(__func__, __LINE__,
                                                       STWExceptionReportForImage(
                                                           STWGlobalConfiguration::sharedInstance()->isInternalImage())));
        return false;
    }
}

void STWContainerMigrator::_migrateOldLogFiles() {
    auto fileManager = STWFileManager::defaultManager();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto userConfiguration =
        configuration->getPerUserConfigurationForUserIdentity(STWUserIdentityCache::defaultUserIdentity());
    fs::path oldDirectory = userConfiguration->oldLoggingPath();
    if (fileManager->itemDoesNotExistAtURL(oldDirectory))
        return; // the usual case: nothing of an older release's logs
    STWErrorRef error;
    STWFileDescriptor parent =
        fileManager->openDirectoryAtURL(oldDirectory.parent_path(), userConfiguration->userHomeDirectory(), &error);
    STWFileDescriptor directory;
    if (parent)
        directory = fileManager->openBeneath(parent.get(), oldDirectory.filename(), O_RDONLY | O_DIRECTORY, 0,
                                             STWOpenBeneathNoSymlinks, &error);
    if (!directory) {
        if (!error || !error->isPOSIX(ENOENT))
            STW_LOG_ERROR(kCategory, "Failed to get items for deletion: %@ : %@", oldDirectory, error);
        return;
    }
    if (auto items = fileManager->itemsInDirectoryAt(directory.get(), oldDirectory, &error)) {
        fs::path logDirectory = configuration->logDirectory();
        STWFileDescriptor logfd = fileManager->openDirectoryAtURL(logDirectory, &error);
        int keep = configuration->diskLogLevel();
        for (const auto& item : *items) {
            long long number = extensionNumber(item.name);
            if (!logfd || number + 1 > keep)
                continue;
            fs::path from = oldDirectory / item.name;
            std::string name = fs::path(item.name).stem().string() + STWFormat(".%ld", number + 1);
            // The app owns the directory: only a regular file with no other name moves, and
            // only the very file checked arrives.
            STWErrorRef moveError;
            STWFileDescriptor file(openat(directory.get(), item.name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
            struct stat st;
            if (!file || fstat(file.get(), &st) != 0 || !S_ISREG(st.st_mode) || st.st_nlink != 1)
                moveError = STW_POSIX_ERROR_NOLOG(file ? EPERM : errno, "%@ is not a log file of ours", from);
            else
                fileManager->moveDirectoryAt(directory.get(), item.name, logfd.get(), name, file.get(),
                                             STWFileManagerMoveDefault, from, logDirectory / name, &moveError);
            if (moveError)
                STW_LOG_ERROR(kCategory, "Failed to move to new logging directory from %@ : %@", from, moveError);
        }
        if (!logfd)
            STW_LOG_ERROR(kCategory, "Failed to move to new logging directory from %@ : %@", oldDirectory, error);
        STW_LOG_NOTICE(kCategory, "Migrated log files on %@", oldDirectory);
    } else if (!error || !error->isPOSIX(ENOENT)) {
        STW_LOG_ERROR(kCategory, "Failed to get items for deletion: %@ : %@", oldDirectory, error);
    }
    STWErrorRef removeError;
    if (!fileManager->removeDirectoryAt(parent.get(), oldDirectory.filename(), directory.get(), oldDirectory,
                                        &removeError))
        STW_LOG_ERROR(kCategory, "Failed to remove old Log directory: %@", removeError);
}

bool STWContainerMigrator::_moveLegacyBundleDirectoryWithError(STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    fs::path legacy = STWPlatformConfiguration::sharedInstance()->resolve(kLegacyBundleDirectory);
    if (fileManager->itemDoesNotExistAtURL(legacy))
        return true; // moved long ago, or never there
    STWErrorRef openError;
    STWFileDescriptor legacyParent = fileManager->openDirectoryAtURLWithoutForeignLinks(legacy.parent_path(), &openError);
    STWFileDescriptor bundle;
    if (legacyParent)
        bundle = fileManager->openBeneath(legacyParent.get(), legacy.filename(), O_RDONLY | O_DIRECTORY, 0,
                                          STWOpenBeneathNoSymlinks, &openError);
    if (!bundle) {
        if (openError && (openError->isPOSIX(ELOOP) || openError->isPOSIX(ENOTDIR)))
            STW_LOG_ERROR(kCategory, "Not moving %@, which is no directory: %@", legacy, openError);
        else if (!openError || !openError->isPOSIX(ENOENT))
            return STWSetError(error, openError), false;
        return true;
    }
    STW_LOG_NOTICE(kCategory, "Moving bundle containers from user to system location");
    auto configuration = STWGlobalConfiguration::sharedInstance();
    fs::path destination = configuration->bundleDirectory();
    STWFileDescriptor containers = fileManager->openDirectoryAtURLWithoutForeignLinks(destination.parent_path(), error);
    if (!containers || !removeEmptyLayoutDirectory(containers.get(), destination.filename(), destination, error))
        return false;
    // It lay in the user's home; in the global layout only root may change it.
    if (fchown(bundle.get(), 0, 0) != 0 || fchmod(bundle.get(), 0755) != 0) {
        int e = errno;
        return STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot take over %@: %s", legacy, strerror(e))), false;
    }
    if (!fileManager->moveDirectoryAt(legacyParent.get(), legacy.filename(), containers.get(), destination.filename(),
                                      bundle.get(), STWFileManagerMoveSyncDirectories, legacy, destination, error))
        return false;
    STW_CRASH_POINT(STWCrashPoint::migrationAfterBundleMove);
    return true;
}

void STWContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(STWMigrationStatus& status) {
    if (status.hasMigrationOccurredForType(STWMigrationType::acl))
        return;
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto fileManager = STWFileManager::defaultManager();
    for (STWContainerClass containerClass : kSystemClasses) {
        auto directory = configuration->globalContainerBaseURLWithContentClass(containerClass, false);
        if (directory && !fileManager->itemDoesNotExistAtURL(*directory))
            return;
    }
    STW_LOG_NOTICE(kCategory, "No system containers requiring ACL migration");
    status.setMigrationCompleteForType(STWMigrationType::acl);
}

bool STWContainerMigrator::_performWhitelistMigrationWithError(STWErrorRef* error) {
    auto userIdentity = STWUserIdentityCache::defaultUserIdentity();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto cache = STWContainerCache::sharedInstance();
    auto whitelist = STWWhitelist::sharedWhitelist();
    STWErrorRef firstError;
    auto failed = [&](const STWErrorRef& e) {
        if (!firstError)
            firstError = e;
    };
    // A rename changes the set of containers of the class.
    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    for (STWContainerClass containerClass : kSystemClasses) {
        auto classDirectory = configuration->containerDirectoryURLForUserIdentity(userIdentity, containerClass, false);
        STWErrorRef listError;
        auto containers = classDirectory ? cache->allContainersForUserIdentity(userIdentity, containerClass, false,
                                                                               &listError)
                                         : std::nullopt;
        if (!containers) {
            if (!listError)
                listError = STW_ERROR_NOLOG(STWErrorInvalidClass, nullptr, "No directory for class %llu",
                                            containerClass);
            STW_LOG_ERROR(kCategory, "Failed to get list of system containers for migration: (error= %@ : %lld)",
                          listError, listError->code());
            return STWSetError(error, listError), false;
        }
        for (const STWMetadataRef& container : *containers) {
            auto name = whitelist->wellknownContainerForId(container->identifier(), containerClass);
            fs::path destination = *classDirectory / (name ? *name : std::string());
            if (!name || container->url() == destination)
                continue;
            STW_LOG_NOTICE(kCategory, "Migrating well-known container %@ from %@ to %@", container->identifier(),
                           container->url(), destination);
            STWErrorRef stepError;
            if (!cache->removeContainerForUserIdentity(container->userIdentity(), containerClass,
                                                       container->identifier(), false, &stepError)) {
                STW_LOG_ERROR(kCategory, "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
                              __func__, container->identifier(), stepError, stepError ? stepError->code() : 0);
                failed(stepError);
                continue;
            }
            auto moved = std::make_shared<STWMetadata>(*container);
            if (container->moveContainerDirectory(destination, STWFileManagerMoveSyncDirectories, &stepError)) {
                STW_CRASH_POINT(STWCrashPoint::migrationAfterWellKnownMove);
                moved->setUrl(destination);
            } else {
                // It stays where it was, and the cache keeps finding it there.
                STW_LOG_ERROR(kCategory,
                              "%s: Failed to move system container %@ from %@ to whitelisted location %@: "
                              "(error= %@: %lld)",
                              __func__, container->identifier(), container->url(), destination, stepError,
                              stepError ? stepError->code() : 0);
                failed(stepError);
            }
            STWErrorRef addError;
            if (!cache->addContainerMetadata(moved, moved->url(), false, true, &addError)) {
                STW_LOG_ERROR(kCategory, "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
                              __func__, container->identifier(), addError, addError ? addError->code() : 0);
                failed(addError);
            }
        }
    }
    if (firstError)
        STWSetError(error, firstError);
    return !firstError;
}
