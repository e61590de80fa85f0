// The per-user half of the directory layout: the container directories below one user
// identity's home directory. Made and kept by STWGlobalConfiguration, one per identity.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWUserIdentity.h"

#include <filesystem>
#include <mutex>
#include <optional>

class STWPerUserConfiguration {
public:
    explicit STWPerUserConfiguration(STWUserIdentityRef userIdentity);

    const STWUserIdentityRef& userIdentity() const { return _userIdentity; }
    const std::filesystem::path& userHomeDirectory() const { return _userHomeDirectory; }

    std::filesystem::path userBaseDirectory();
    std::filesystem::path transientDirectory();
    std::filesystem::path stagingDirectory();
    std::filesystem::path libraryDirectory();
    std::filesystem::path systemContainerBackupBaseDirectory();
    std::filesystem::path systemContainerBackupDirectory();
    std::filesystem::path systemGroupContainerBackupDirectory();
    std::filesystem::path oldLoggingPath();

    // Per-user classes only; any other class is logged and answers nullopt.
    std::optional<std::filesystem::path> containerDirectoryURLForContentClass(STWContainerClass contentClass,
                                                                             bool transient);
    bool existsUserBaseDirectory();

private:
    // Under the lock: computes the path once (`compute` may ask a parent accessor), then
    // creates it, as on every call.
    template <class Compute>
    std::filesystem::path _created(std::optional<std::filesystem::path>& slot, Compute&& compute,
                                   const char* failureMessage);

    std::recursive_mutex _lock;
    STWUserIdentityRef _userIdentity;
    std::optional<std::filesystem::path> _userBaseDirectory, _transientDirectory, _stagingDirectory, _libraryDirectory;
    std::filesystem::path _userHomeDirectory;
};
