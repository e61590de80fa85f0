// The per-user half of the directory layout: the container directories below one user
// identity's home directory. Made and kept by STWGlobalConfiguration, one per identity.
#pragma once

#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWUserIdentity.h"

#include <filesystem>
#include <map>
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
    // Under the lock: the path when the directory made there is still in place; otherwise
    // the path computed (`compute` may ask a parent accessor, which puts the parent in
    // place first) with the directory made again.
    template <class Compute>
    std::filesystem::path _created(std::optional<std::filesystem::path>& slot, Compute&& compute,
                                   const char* failureMessage);

    std::recursive_mutex _lock;
    STWUserIdentityRef _userIdentity;
    std::optional<std::filesystem::path> _userBaseDirectory, _transientDirectory, _stagingDirectory, _libraryDirectory;
    // The class directories, by class and transient.
    std::map<std::pair<STWContainerClass, bool>, std::optional<std::filesystem::path>> _containerDirectories;
    std::filesystem::path _userHomeDirectory;
};
