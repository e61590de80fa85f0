// What the platform tells the daemon about the device it runs on: the root prefix under
// which every path of the layout lives, the answers of the platform queries (internal
// build, multi-user, persona support, features) read from etc/stowly/stowlyd.plist, and
// the running system's version from os-release.
#pragma once

#include "common/STWError.h"
#include "common/STWValue.h"

#include <chrono>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <sys/types.h>

// What clients of the request socket may hold (see STWIPCListener), from stowlyd.plist:
// "MaxConnections", "MaxConnectionsPerUser" (counts; unset, the daemon derives them from
// its descriptor limit), "FirstFrameTimeout", "FrameTimeout" (seconds) and
// "MaxPendingFrameBytes".
struct STWClientBounds {
    std::optional<size_t> maxConnections;
    std::optional<size_t> maxConnectionsPerUser;
    std::chrono::milliseconds firstFrameTimeout{60000};
    std::chrono::milliseconds frameTimeout{10000};
    size_t maxPendingFrameBytes = 64 * 1024 * 1024;
};

class STWPlatformConfiguration {
public:
    // The configuration in force: what the daemon loaded at start, or the defaults for
    // the root "/" when nothing was loaded.
    static std::shared_ptr<const STWPlatformConfiguration> sharedInstance();
    static void setSharedInstance(std::shared_ptr<const STWPlatformConfiguration> configuration);

    // Reads `root`/etc/stowly/stowlyd.plist (absent: defaults) and the os-release file.
    // A file that is not a property-list dictionary, or a key of the wrong type, fails
    // with an error naming the path and the key.
    static std::shared_ptr<const STWPlatformConfiguration> loadFromRoot(const std::filesystem::path& root,
                                                                        STWErrorRef* error);

    const std::filesystem::path& rootPrefix() const { return _root; }
    bool hasPrivateRoot() const { return _root != "/"; }
    // `absolute` ("/private/var/containers") resolved under the root prefix.
    std::filesystem::path resolve(const std::filesystem::path& absolute) const;
    std::filesystem::path configurationDirectory() const { return resolve("/etc/stowly"); }
    std::filesystem::path runtimeDirectory() const { return resolve("/run/stowly"); }
    std::filesystem::path configurationFile() const { return configurationDirectory() / "stowlyd.plist"; }
    // The named semaphore that marks "started since power-on" (a reboot clears it);
    // daemons of different root prefixes never share it.
    std::string firstBootSemaphoreName() const;

    bool isInternalImage() const { return _internalImage; }
    bool isMultiUser() const { return _multiUser; }
    bool personasUnsupported() const { return _personasUnsupported; }
    bool hasEphemeralStorage() const { return _ephemeralStorage; }
    // Developer mode is never on for the real root.
    bool isDeveloperMode() const { return _developerMode; }
    bool isFeatureEnabled(std::string_view feature) const;
    uid_t installationUID() const { return _installationUID; }
    uid_t systemContainerUID() const { return _systemContainerUID; }
    const std::string& mobileUserName() const { return _mobileUserName; }
    const STWClientBounds& clientBounds() const { return _clientBounds; }

    // "BuildVersion", "ProductVersion" and "ReleaseType" of the running system, as far
    // as os-release gives them.
    const STWValue::Dictionary& systemVersion() const { return _systemVersion; }

    // The whole configuration dictionary, for settings that belong to one subsystem.
    const STWValue::Dictionary& settings() const { return _settings; }

    explicit STWPlatformConfiguration(std::filesystem::path root);

private:
    std::filesystem::path _root;
    bool _internalImage = false;
    bool _multiUser = false;
    bool _personasUnsupported = false;
    bool _ephemeralStorage = false;
    bool _developerMode = false;
    uid_t _installationUID = 33;
    uid_t _systemContainerUID = 0;
    std::string _mobileUserName = "mobile";
    STWClientBounds _clientBounds;
    STWValue::Dictionary _features;
    STWValue::Dictionary _systemVersion;
    STWValue::Dictionary _settings;
};

// Parses os-release text (KEY=value lines, values optionally quoted) into a dictionary.
STWValue::Dictionary STWParseOSRelease(std::string_view text);
