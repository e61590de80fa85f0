#include "Daemon/Model/STWPerUserConfiguration.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWLog.h"

STWPerUserConfiguration::STWPerUserConfiguration(STWUserIdentityRef userIdentity)
    : _userIdentity(std::move(userIdentity)) {
    _userHomeDirectory = _userIdentity->homeDirectoryURL();
    if (_userHomeDirectory.empty())
        STW_LOG_FAULT(STWLogCategory::Unspecified, "Home directory cannot be nil: %@", _userIdentity);
}

std::filesystem::path STWPerUserConfiguration::_created(std::optional<std::filesystem::path>& slot,
                                                        const std::filesystem::path& computed,
                                                        const char* failureMessage) {
    std::filesystem::path path;
    {
        std::lock_guard guard(_lock);
        if (!slot)
            slot = computed;
        path = *slot;
    }
    STWCreateLayoutDirectory(path, 0755, _userIdentity->posixUID(), -1, failureMessage);
    return path;
}

std::filesystem::path STWPerUserConfiguration::userBaseDirectory() {
    return _created(_userBaseDirectory, _userHomeDirectory / "Containers", "Failed to create user base dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::transientDirectory() {
    return _created(_transientDirectory, userBaseDirectory() / "Temp", "Failed to create transient dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::stagingDirectory() {
    return _created(_stagingDirectory, userBaseDirectory() / "Staging", "Failed to create staging dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::libraryDirectory() {
    return _created(_libraryDirectory, _userHomeDirectory / "Library/Stowly",
                    "Failed to create user library dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::systemContainerBackupBaseDirectory() {
    return _userHomeDirectory / "Library/Backup/SystemContainers";
}

std::filesystem::path STWPerUserConfiguration::systemContainerBackupDirectory() {
    return systemContainerBackupBaseDirectory() / "Data";
}

std::filesystem::path STWPerUserConfiguration::systemGroupContainerBackupDirectory() {
    return systemContainerBackupBaseDirectory() / "Shared";
}

std::filesystem::path STWPerUserConfiguration::oldLoggingPath() { return _userHomeDirectory / "Library/Logs/Stowly"; }

std::optional<std::filesystem::path> STWPerUserConfiguration::containerDirectoryURLForContentClass(
    STWContainerClass contentClass, bool transient) {
    if (!STWContainerClassIsPerUser(contentClass)) {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Invalid class for a per user container directory: %llu",
                      contentClass);
        return std::nullopt;
    }
    std::filesystem::path path = (transient ? transientDirectory() : userBaseDirectory()) /
                                 STWContainerClassDirectoryName(contentClass);
    STWCreateLayoutDirectory(path, 0755, _userIdentity->posixUID(), -1, "Failed to create container dir at \"%@\": %@");
    return path;
}

bool STWPerUserConfiguration::existsUserBaseDirectory() {
    return STWFileManager::defaultManager()->itemExistsAtURL(_userHomeDirectory);
}
