// The daemon's directory layout: its own state directories and the global container
// directories, plus the per-user configuration of every user identity. Every directory
// accessor creates what it returns, with its mode, owner and data-protection class, on
// every call, so a base directory removed behind the daemon's back comes back on next use;
// creation failures are logged and the path is still returned.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWPerUserConfiguration.h"
#include "Daemon/Model/STWUserIdentity.h"

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

class STWGlobalConfiguration {
public:
    static std::shared_ptr<STWGlobalConfiguration> sharedInstance();
    STWGlobalConfiguration();

    std::filesystem::path homeDirectory();
    std::filesystem::path sharedContainersDirectory();
    std::filesystem::path bundleDirectory();
    std::filesystem::path transientBundleDirectory();
    std::filesystem::path cachesDirectory();
    std::filesystem::path stagingDirectory();
    std::filesystem::path deathrowDirectory();
    std::filesystem::path transientDirectory();
    std::filesystem::path libraryDirectory();
    std::filesystem::path replaceDirectory();
    std::filesystem::path pendingUpdatesDirectory();
    std::filesystem::path logDirectory();
    // Never created: the path when it exists, else nullopt.
    std::optional<std::filesystem::path> legacyTransientBundleDirectory();

    std::shared_ptr<STWPerUserConfiguration> getPerUserConfigurationForUserIdentity(const STWUserIdentityRef& identity);
    // The class directory of a global class, not created; nullopt for other classes.
    std::optional<std::filesystem::path> globalContainerBaseURLWithContentClass(STWContainerClass contentClass,
                                                                               bool transient);
    // The class directory, created; per-user classes (and invalid numbers) go to the
    // identity's per-user configuration, which refuses the invalid ones.
    std::optional<std::filesystem::path> containerDirectoryURLForUserIdentity(const STWUserIdentityRef& identity,
                                                                             STWContainerClass contentClass,
                                                                             bool transient);
    std::filesystem::path stagingDirectoryURLForUserIdentity(const STWUserIdentityRef& identity,
                                                             STWContainerClass contentClass);

    static const std::vector<std::string>& appUserDataItemNames();
    static const std::vector<std::string>& excludedFromAppUserData();
    bool migrationFileExistsWithName(const std::string& name);

    bool isInternalImage();
    void setIsInternalImage(bool internal);
    // How many rotated log files are kept beside stowlyd.log: 1, or 4 on internal builds.
    int diskLogLevel();
    uid_t currentMobileUserId() const { return _currentMobileUserId; }
    gid_t currentMobileGroupId() const { return _currentMobileGroupId; }

private:
    // Under the lock: computes the path once from its parent accessor (`compute`), then
    // creates it with the given attributes, as on every call.
    template <class Compute>
    std::filesystem::path _directory(std::optional<std::filesystem::path>& slot, Compute&& compute, uint16_t mode,
                                     uid_t owner, int32_t protectionClass, const char* failureMessage);

    std::recursive_mutex _lock;
    std::optional<std::filesystem::path> _homeDirectory, _sharedContainersDirectory, _cachesDirectory,
        _libraryDirectory, _stagingDirectory, _deathrowDirectory, _replaceDirectory, _pendingUpdatesDirectory,
        _bundleDirectory, _transientDirectory, _transientBundleDirectory;
    uid_t _currentMobileUserId = 0;
    std::unordered_map<std::string, std::shared_ptr<STWPerUserConfiguration>> _perUserConfigurations;
    std::optional<bool> _isInternalImage;
    gid_t _currentMobileGroupId = 0;
};

// Creates `path` with intermediate directories and the given attributes, logging
// `failureMessage` (with the path and the error) when that fails. Shared by the global and
// the per-user layout. Below a `trustedAncestor` (a user's home, whose contents the user
// owns) nothing is followed: a link in place of a directory is removed.
void STWCreateLayoutDirectory(const std::filesystem::path& path, uint16_t mode, uid_t owner, int32_t protectionClass,
                              const char* failureMessage, const std::filesystem::path& trustedAncestor = {});

// The directory below which the layout of a class is the user's to change: the user's
// home for per-user classes, nothing (empty) for the global ones.
std::filesystem::path STWTrustedAncestorForClass(const STWUserIdentityRef& userIdentity,
                                                 STWContainerClass containerClass);
