// System containers restored from a backup: the restore leaves their content in the current
// user's backup directories, and the first start after power-on installs it. The backup
// directories are renamed to "inprogress" first, so a start that dies half-way finds what
// is left there and a later restore replaces it; each item is moved over the live
// container's item of the same name, and one that cannot be is kept in the failed-items
// directory beside the restored data.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWLog.h"

#include <cerrno>
#include <cstring>
#include <fcntl.h>
#include <sys/stat.h>

namespace fs = std::filesystem;

namespace {

constexpr const char* kLogName = "STWMoveSystemContainersIntoPlace";

// `url` with `extension` appended to its last component.
fs::path withExtension(const fs::path& url, const char* extension) {
    fs::path result = url;
    result += '.';
    result += extension;
    return result;
}

// Removes the item at `url` without following a link on the way or in its place (the backup
// directories lie in a user's home); a missing item is removed.
bool removeItemWithoutForeignLinks(const fs::path& url, STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    STWFileDescriptor parent = fileManager->openDirectoryAtURLWithoutForeignLinks(url.parent_path(), error);
    if (!parent)
        return error && *error && (*error)->isPOSIX(ENOENT);
    std::string name = url.filename();
    struct stat st;
    if (fstatat(parent.get(), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) {
        int e = errno;
        if (e == ENOENT)
            return true;
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot examine %@: %s", url, strerror(e)));
        return false;
    }
    if (!S_ISDIR(st.st_mode)) {
        if (unlinkat(parent.get(), name.c_str(), 0) == 0 || errno == ENOENT)
            return true;
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot remove %@: %s", url, strerror(e)));
        return false;
    }
    STWFileDescriptor directory(
        openat(parent.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (!directory) {
        int e = errno;
        STWSetError(error, STW_POSIX_ERROR_NOLOG(e, "Cannot open %@: %s", url, strerror(e)));
        return false;
    }
    return fileManager->removeDirectoryAt(parent.get(), name, directory.get(), url, error);
}

} // namespace

void STWClientConnection::_moveSystemContainersIntoPlace() {
    auto fileManager = STWFileManager::defaultManager();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto perUser = configuration->getPerUserConfigurationForUserIdentity(
        _userIdentityCache->userIdentityForCurrentContext());
    if (!perUser)
        return;
    struct Backup {
        fs::path directory;
        STWContainerClass containerClass;
        const char* moveFailure;
        const char* installing;
        const char* listFailure;
        bool moved = false;
    };
    Backup backups[] = {
        {perUser->systemContainerBackupDirectory(), STWContainerClassDataSystem,
         "Failed to move system containers to inprogress: %@", "Installing system containers",
         "Couldn't find any system containers at %@: %@"},
        {perUser->systemGroupContainerBackupDirectory(), STWContainerClassSharedSystemGroup,
         "Failed to move shared system containers to inprogress: %@", "Installing system group containers",
         "Couldn't find any system shared containers at %@: %@"},
    };
    for (Backup& backup : backups) {
        if (!fileManager->itemExistsAtURL(backup.directory))
            continue;
        // A new backup replaces whatever an earlier, interrupted installation left.
        fs::path inprogress = withExtension(backup.directory, "inprogress");
        STWErrorRef error;
        if (!removeItemWithoutForeignLinks(inprogress, &error))
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                       "Failed to remove existing inprogress system containers: %@", error);
        if (fileManager->moveItemAtURLWithoutForeignLinks(backup.directory, inprogress,
                                                          STWFileManagerMoveDefault, &error))
            backup.moved = true;
        else
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle, backup.moveFailure, error);
    }
    for (const Backup& backup : backups) {
        if (!backup.moved)
            continue;
        STW_LOG_FN(kLogName, STWLogLevel::Notice, STWLogCategory::Lifecycle, "%s", backup.installing);
        fs::path inprogress = withExtension(backup.directory, "inprogress");
        STWErrorRef error;
        STWFileDescriptor directory = fileManager->openDirectoryAtURLWithoutForeignLinks(inprogress, &error);
        auto items =
            directory ? fileManager->itemsInDirectoryAt(directory.get(), inprogress, &error) : std::nullopt;
        if (!items) {
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle, backup.listFailure,
                       inprogress, error);
            continue;
        }
        for (const auto& item : *items)
            _moveSystemContainerIntoPlace(inprogress / item.name, backup.containerClass);
    }
    // An internal image keeps what was restored, and what failed, for a look afterwards.
    if (!configuration->isInternalImage()) {
        fs::path base = perUser->systemContainerBackupBaseDirectory();
        STWErrorRef error;
        if (!removeItemWithoutForeignLinks(base, &error))
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                       "Failed to remove system container base dir %@: %@", base, error);
    }
}

void STWClientConnection::_moveSystemContainerIntoPlace(const fs::path& restored,
                                                        STWContainerClass containerClass) {
    auto fileManager = STWFileManager::defaultManager();
    std::string identifier = restored.filename();
    fs::path failedDirectory = withExtension(restored.parent_path(), "failed") / identifier;
    uint64_t code = STWErrorSuccess;
    auto identity = STWContainerIdentity::containerIdentityWithIdentifier(identifier, containerClass, &code);
    if (!identity) {
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                   "Failed to create container identity %@: %llu", identifier, code);
        return;
    }
    auto container = createOrLookupContainerWithContainerIdentity(identity, true, false, true, &code);
    if (!container) {
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                   "Failed to create system container %@: %llu", identifier, code);
        return;
    }
    fs::path destination = container->url();
    STW_LOG_FN(kLogName, STWLogLevel::Notice, STWLogCategory::Lifecycle,
               "Restoring container for %@ at %@ to %@", identifier, restored, destination);
    STWErrorRef error;
    STWFileDescriptor directory = fileManager->openDirectoryAtURLWithoutForeignLinks(restored, &error);
    // Hidden entries (the backup's metadata file among them) stay: the live container keeps its own.
    auto items =
        directory ? fileManager->itemsInDirectoryAt(directory.get(), restored, &error) : std::nullopt;
    if (!items) {
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                   "Failed to enumerate contents of restored system container %@ at %@: %@", identifier,
                   restored, error);
        return;
    }
    for (const auto& entry : *items) {
        fs::path from = restored / entry.name;
        fs::path to = destination / entry.name;
        STWErrorRef itemError;
        if (!removeItemWithoutForeignLinks(to, &itemError)) {
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                       "Failed to remove destination %@:%@: %@", identifier, entry.name, itemError);
            _moveFailedPathAside(from, failedDirectory);
        } else if (!fileManager->moveItemAtURLWithoutForeignLinks(from, to, STWFileManagerMoveDefault,
                                                                  &itemError)) {
            STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                       "Failed to move file in restored system container %@:%@ to destination %@: %@",
                       identifier, entry.name, to, itemError);
            _moveFailedPathAside(from, failedDirectory);
        }
    }
    code = STWErrorSuccess;
    if (!recreateDefaultStructureWithContainerIdentity(container->containerIdentity(), &code))
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle,
                   "Error processing restored system container %@: %llu", identifier, code);
}

void STWClientConnection::_moveFailedPathAside(const fs::path& item, const fs::path& failedDirectory) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef error;
    if (!fileManager->createDirectoryAtURL(failedDirectory, true, 0777, &error)) {
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle, "Failed to create %@: %@",
                   failedDirectory, error);
        return;
    }
    fs::path to = failedDirectory / item.filename();
    if (!fileManager->moveItemAtURLWithoutForeignLinks(item, to, STWFileManagerMoveDefault, &error))
        STW_LOG_FN(kLogName, STWLogLevel::Error, STWLogCategory::Lifecycle, "Failed to move %@ to %@: %@",
                   item, to, error);
}
