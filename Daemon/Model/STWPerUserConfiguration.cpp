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

template <class Compute>
std::filesystem::path STWPerUserConfiguration::_created(std::optional<std::filesystem::path>& slot, Compute&& compute,
                                                        const char* failureMessage) {
    std::lock_guard guard(_lock);
    uid_t owner = _userIdentity->posixUID();
    if (slot && STWLayoutDirectoryIsInPlace(*slot, owner, -1, _userHomeDirectory))
        return *slot;
    slot = compute();
    STWCreateLayoutDirectory(*slot, 0755, owner, -1, failureMessage, _userHomeDirectory);
    return *slot;
}

std::filesystem::path STWPerUserConfiguration::userBaseDirectory() {
    return _created(
        _userBaseDirectory, [this] { return _userHomeDirectory / "Containers"; },
        "Failed to create user base dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::transientDirectory() {
    return _created(
        _transientDirectory, [this] { return userBaseDirectory() / "Temp"; },
        "Failed to create transient dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::stagingDirectory() {
    return _created(
        _stagingDirectory, [this] { return userBaseDirectory() / "Staging"; },
        "Failed to create staging dir at \"%@\": %@");
}

std::filesystem::path STWPerUserConfiguration::libraryDirectory() {
    return _created(
        _libraryDirectory, [this] { return _userHomeDirectory / "Library/Stowly"; },
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
    std::lock_guard guard(_lock);
    return _created(
        _containerDirectories[{contentClass, transient}],
        [&] {
            return (transient ? transientDirectory() : userBaseDirectory()) /
                   STWContainerClassDirectoryName(contentClass);
        },
        "Failed to create container dir at \"%@\": %@");
}

bool STWPerUserConfiguration::existsUserBaseDirectory() {
    return STWFileManager::defaultManager()->itemExistsAtURL(_userHomeDirectory);
}
