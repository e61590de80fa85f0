#include "Daemon/Migration/STWMigrationStatus.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "common/STWPropertyList.h"
#include "platform/STWPlatformConfiguration.h"

#include <cerrno>
#include <fcntl.h>
#include <sys/stat.h>
#include <utility>

namespace fs = std::filesystem;

namespace {

constexpr auto kCategory = STWLogCategory::Lifecycle;

constexpr std::pair<const char*, const char*> markerFiles[] = {
    {"stw_bundle_migration_complete.plist", STWMigrationType::bundle},
    {"stw_acl2_migration_complete.plist", STWMigrationType::acl},
    {"stw_group_id_migration_complete.plist", STWMigrationType::groupId},
    {"stw_code_signing_migration_complete.plist", STWMigrationType::codeSigning},
};

const STWValue::Dictionary& currentBuildInfo() {
    return STWPlatformConfiguration::sharedInstance()->systemVersion();
}

} // namespace

STWMutex STWMigrationStatus::_fileLock;

std::shared_ptr<STWMigrationStatus> STWMigrationStatus::initForSystemMigration() {
    auto status = std::make_shared<STWMigrationStatus>(
        STWGlobalConfiguration::sharedInstance()->libraryDirectory() / systemFileName, true);
    if (!status->migrationInfo())
        STW_LOG_ERROR(kCategory, "Error reading system migration file from disk.  This is bad");
    return status;
}

std::shared_ptr<STWMigrationStatus> STWMigrationStatus::initForMobileUserMigration() {
    auto userConfiguration = STWGlobalConfiguration::sharedInstance()->getPerUserConfigurationForUserIdentity(
        STWUserIdentityCache::defaultUserIdentity());
    auto status = std::make_shared<STWMigrationStatus>(userConfiguration->libraryDirectory() / userFileName, false,
                                                       userConfiguration->userHomeDirectory());
    if (!status->migrationInfo())
        STW_LOG_ERROR(kCategory, "Error reading user migration file from disk.  This is bad");
    return status;
}

STWMigrationStatus::STWMigrationStatus(fs::path url, bool foldMarkerFiles, fs::path trustedAncestor)
    : _migrationFileURL(std::move(url)), _trustedAncestor(std::move(trustedAncestor)) {
    STWLockGuard guard(_fileLock);
    _migrationInfo = readMigrationInfo(_migrationFileURL, _trustedAncestor);
    if (foldMarkerFiles && _migrationInfo && _migrationInfo->empty())
        _foldMarkerFiles();
}

std::optional<STWValue::Dictionary> STWMigrationStatus::readMigrationInfo(const fs::path& url,
                                                                          const fs::path& trustedAncestor) {
    // The directory is opened without following a link below the ancestor, the file
    // without following one or blocking on a FIFO, and only a regular file is read.
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef error;
    std::string bytes;
    if (fileManager->itemDoesNotExistAtURL(url))
        return STWValue::Dictionary{};
    STWFileDescriptor directory = fileManager->openDirectoryAtURL(url.parent_path(), trustedAncestor, &error);
    if (directory) {
        STWFileDescriptor file(
            openat(directory.get(), url.filename().c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        struct stat st;
        int e = !file                           ? errno
                : fstat(file.get(), &st) != 0   ? errno
                : !S_ISREG(st.st_mode)          ? EINVAL
                                                : STWReadDescriptorContents(file.get(), st.st_size, &bytes);
        if (e == ENOENT)
            return STWValue::Dictionary{};
        if (e)
            error = STW_POSIX_ERROR_NOLOG(e, "Could not read property list at %@", url);
    }
    std::optional<STWValue> root = error ? std::nullopt : STWPropertyList::parse(bytes);
    if (root && root->isDictionary())
        return std::move(*root->mutableDictionary());
    if (!error)
        error = STWErrorCreate(STWGenericErrorDomain, STWGenericErrorCorruptFile, __func__, __LINE__, nullptr, false,
                               "Property list at %@ is corrupt", url);
    STW_LOG_ERROR(kCategory, "Failed to read migration status file at %@ : %@", url, error);
    return std::nullopt;
}

bool STWMigrationStatus::_writeMigrationInfo(STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    fs::path parent = _migrationFileURL.parent_path();
    STWFileDescriptor directory = fileManager->openDirectoryAtURL(parent, _trustedAncestor, error);
    if (!directory)
        return false;
    // Written beside the file, synced, and renamed over it: a power cut leaves one or the other.
    auto temporary = fileManager->writeTemporaryFileAt(
        directory.get(), STWPropertyList::serializeBinary(STWValue(*_migrationInfo)), 0644, parent, error);
    return temporary && fileManager->replaceFileAt(directory.get(), *temporary, _migrationFileURL.filename(), false,
                                                   nullptr, _migrationFileURL, error);
}

void STWMigrationStatus::_foldMarkerFiles() {
    _fileLock.assertHeld();
    STW_LOG_NOTICE(kCategory, "Migrating from many marker files down to one");
    fs::path directory = _migrationFileURL.parent_path();
    for (const auto& [name, type] : markerFiles) {
        STWErrorRef error;
        auto marker = STW_dictionaryWithContentsOfURL(directory / name, 0, &error);
        if (marker)
            (*_migrationInfo)[type] = std::move(*marker);
        else if (error && !error->isPOSIX(ENOENT))
            STW_LOG_ERROR(kCategory, "Failed to read migration marker file at %@ : %@", directory / name, error);
    }
    STWErrorRef writeError;
    if (!_writeMigrationInfo(&writeError)) {
        // The markers stay: the next start folds them again.
        STW_LOG_ERROR(kCategory, "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(),
                      "marker files", writeError);
        return;
    }
    auto fileManager = STWFileManager::defaultManager();
    for (const auto& [name, type] : markerFiles) {
        STWErrorRef removeError;
        if (!fileManager->removeItemAtURL(directory / name, &removeError) && removeError &&
            !removeError->isPOSIX(ENOENT))
            STW_LOG_ERROR(kCategory, "Failed to remove migration marker file at %@ : %@", directory / name,
                          removeError);
    }
}

std::optional<STWValue::Dictionary> STWMigrationStatus::migrationInfo() {
    STWLockGuard guard(_fileLock);
    return _migrationInfo;
}

bool STWMigrationStatus::hasMigrationOccurredForType(const std::string& type) {
    STWLockGuard guard(_fileLock);
    return _migrationInfo && STWDictionaryFind(*_migrationInfo, type);
}

template <class Change>
bool STWMigrationStatus::_update(const std::string& what, Change&& change) {
    STWLockGuard guard(_fileLock);
    // Another store object over the same file may have recorded something since we read.
    auto current = readMigrationInfo(_migrationFileURL, _trustedAncestor);
    if (!current) {
        // An unreadable store is left as it is for someone to look at; the migrations it
        // should have recorded run again next time, which they are made to survive.
        STW_LOG_ERROR(kCategory, "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(), what,
                      "the status file is unreadable");
        return false;
    }
    _migrationInfo = std::move(current);
    change(*_migrationInfo);
    STWErrorRef error;
    if (!_writeMigrationInfo(&error)) {
        STW_LOG_ERROR(kCategory, "Failed to write migration status on %@ for %@ : %@", currentBuildVersion(), what,
                      error);
        return false;
    }
    return true;
}

void STWMigrationStatus::setMigrationCompleteForType(const std::string& type) {
    std::string build = currentBuildVersion();
    bool written = _update(type, [&](STWValue::Dictionary& info) {
        info[type] = STWValue::Dictionary{{versionNumberKey, build}, {timeKey, STWDate::now().description()}};
    });
    if (written)
        STW_LOG_NOTICE(kCategory, "Migration completed on %@ for %@", build, type);
}

void STWMigrationStatus::writeCurrentBuildInfoToDisk() {
    if (_update(lastBuildInfoKey, [](STWValue::Dictionary& info) { info[lastBuildInfoKey] = currentBuildInfo(); }))
        STW_LOG_NOTICE(kCategory, "Saved last build version of %@", currentBuildVersion());
}

bool STWMigrationStatus::isBuildUpgrade() {
    std::optional<STWValue::Dictionary> lastInfo;
    {
        STWLockGuard guard(_fileLock);
        if (_migrationInfo)
            if (const STWValue::Dictionary* last = STWDictionaryDictionary(*_migrationInfo, lastBuildInfoKey))
                lastInfo = *last;
    }
    if (!lastInfo) {
        STW_LOG_NOTICE(kCategory, "Did not find last build info; we must be upgrading from pre-9.3.1 or this is an "
                                  "erase install.");
        return true;
    }
    const std::string* lastBuild = STWDictionaryString(*lastInfo, "BuildVersion");
    if (!lastBuild) {
        STW_LOG_NOTICE(kCategory, "Could not get build version from last build info dictionary; assuming this is "
                                  "an upgrade");
        return true;
    }
    const STWValue::Dictionary& current = currentBuildInfo();
    if (current.empty()) {
        STW_LOG_NOTICE(kCategory, "Could not get current build info; assuming this is an upgrade");
        return true;
    }
    const std::string* currentBuild = STWDictionaryString(current, "BuildVersion");
    if (!currentBuild) {
        STW_LOG_NOTICE(kCategory, "Could not get current build string; assuming this is an upgrade");
        return true;
    }
    const std::string* lastType = STWDictionaryString(*lastInfo, "ReleaseType");
    const std::string* currentType = STWDictionaryString(current, "ReleaseType");
    std::string lastRelease = lastType ? *lastType : "", currentRelease = currentType ? *currentType : "";
    if (*lastBuild == *currentBuild) {
        STW_LOG_NOTICE(kCategory, "Current build version (%@ / %@) equal to last version recorded (%@ / %@); "
                                  "skipping upgrade",
                       *currentBuild, currentRelease, *lastBuild, lastRelease);
        return false;
    }
    STW_LOG_NOTICE(kCategory, "Detected upgrade from %@ (%@) to %@ (%@)", *lastBuild, lastRelease, *currentBuild,
                   currentRelease);
    return true;
}

std::string STWMigrationStatus::currentBuildVersion() {
    const std::string* build = STWDictionaryString(currentBuildInfo(), "BuildVersion");
    return build ? *build : std::string();
}
