// The daemon's directory layout: its own state directories and the global container
// directories, plus the per-user configuration of every user identity. Every directory
// accessor answers a directory that is there, with its mode, owner and data-protection
// class: the first call makes it, and later calls check with one look-up that the very
// directory made then is still there as it was made (STWLayoutDirectoryIsInPlace), making
// it and its parents again when not, so a base directory removed or replaced behind the
// daemon's back comes back on next use. Creation failures are logged and the path is still
// returned.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWPerUserConfiguration.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "common/STWError.h"
#include "common/STWFileDescriptor.h"

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
    // A layout directory held open, with the path it was opened at.
    struct OpenDirectory {
        std::filesystem::path url;
        STWFileDescriptor fd;
    };
    // deathrowDirectory() held open, for the moves into death row and the passes over it:
    // opened on first use and again once the directory was removed (a descriptor of a
    // removed directory has no links left), so a use costs one fstat. Shared, so that a
    // caller reopening it never closes it under another.
    std::shared_ptr<const OpenDirectory> openDeathrowDirectory(STWErrorRef* error = nullptr);
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
    // Under the lock: the path when the directory made there is still in place; otherwise
    // the path computed from its parent accessor (`compute`, which puts the parent in place
    // first) with the directory made again.
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
    std::shared_ptr<const OpenDirectory> _openDeathrowDirectory;
};

// Creates `path` with intermediate directories and the given attributes, logging
// `failureMessage` (with the path and the error) when that fails. Shared by the global and
// the per-user layout. Below a `trustedAncestor` (a user's home, whose contents the user
// owns) nothing is followed: a link in place of a directory is removed. What it made is
// remembered for STWLayoutDirectoryIsInPlace.
void STWCreateLayoutDirectory(const std::filesystem::path& path, uint16_t mode, uid_t owner, int32_t protectionClass,
                              const char* failureMessage, const std::filesystem::path& trustedAncestor = {});
// Whether the directory that STWCreateLayoutDirectory last made at `path` with this owner
// and class is still there, the same directory (device and inode) with that owner, reached
// from `trustedAncestor` without following any link: one stat (five calls below an
// ancestor). A directory removed, replaced, re-owned or swapped for a link is not.
bool STWLayoutDirectoryIsInPlace(const std::filesystem::path& path, uid_t owner, int32_t protectionClass,
                                 const std::filesystem::path& trustedAncestor = {});

// The directory below which the layout of a class is the user's to change: the user's
// home for per-user classes, nothing (empty) for the global ones.
std::filesystem::path STWTrustedAncestorForClass(const STWUserIdentityRef& userIdentity,
                                                 STWContainerClass containerClass);
