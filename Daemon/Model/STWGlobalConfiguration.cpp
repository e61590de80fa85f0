#include "Daemon/Model/STWGlobalConfiguration.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "common/STWLog.h"
#include "common/STWThreadSafety.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWUserDatabase.h"

#include <fcntl.h>
#include <sys/stat.h>

namespace {

constexpr uint16_t kDirectoryMode = 0755;
constexpr int32_t kNoProtectionClass = 4;
constexpr int32_t kLeaveProtectionClass = -1;

std::filesystem::path underRoot(const char* absolute) {
    return STWPlatformConfiguration::sharedInstance()->resolve(absolute);
}

uid_t installationUID() { return STWPlatformConfiguration::sharedInstance()->installationUID(); }
uid_t systemContainerUID() { return STWPlatformConfiguration::sharedInstance()->systemContainerUID(); }

// The layout directories STWCreateLayoutDirectory made, by path: which directory it was and
// the owner and class it was given. Process-wide, as the directories are; bounded, since
// per-user entries come and go with personas.
struct MadeDirectory {
    dev_t device;
    ino_t inode;
    uid_t owner;
    int32_t protectionClass;
};

class MadeDirectories {
public:
    static MadeDirectories& shared() {
        static MadeDirectories* made = new MadeDirectories; // used by detached queue threads at exit
        return *made;
    }
    std::optional<MadeDirectory> find(const std::string& path) {
        STWLockGuard guard(_mutex);
        auto found = _made.find(path);
        return found == _made.end() ? std::nullopt : std::optional<MadeDirectory>(found->second);
    }
    void remember(const std::string& path, const MadeDirectory& made) {
        STWLockGuard guard(_mutex);
        if (_made.size() >= kLimit)
            _made.clear(); // everything is made again once, at one check's cost more
        _made[path] = made;
    }
    void forget(const std::string& path) {
        STWLockGuard guard(_mutex);
        _made.erase(path);
    }

private:
    static constexpr size_t kLimit = 4096;
    STWMutex _mutex;
    std::unordered_map<std::string, MadeDirectory> _made STW_GUARDED_BY(_mutex);
};

// `path` relative to `trustedAncestor` when it lies below it, else empty.
std::filesystem::path relativeBelow(const std::filesystem::path& path, const std::filesystem::path& trustedAncestor) {
    std::filesystem::path relative =
        trustedAncestor.empty() ? std::filesystem::path() : path.lexically_relative(trustedAncestor);
    if (relative.empty() || *relative.begin() == "..")
        return {};
    return relative;
}

} // namespace

void STWCreateLayoutDirectory(const std::filesystem::path& path, uint16_t mode, uid_t owner, int32_t protectionClass,
                              const char* failureMessage, const std::filesystem::path& trustedAncestor) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef error;
    std::filesystem::path relative = relativeBelow(path, trustedAncestor);
    bool created;
    struct stat made {};
    bool identified = false;
    if (relative.empty()) {
        created = fileManager->createDirectoryAtURL(path, true, mode, owner, protectionClass, &error);
        // Only root can change what lies above it: the path names what was made.
        identified = created && lstat(path.c_str(), &made) == 0;
    } else {
        // The ancestor itself is made as the path says, as any layout directory is.
        STWFileDescriptor ancestor, directory;
        if (fileManager->createDirectoryAtURL(trustedAncestor, true, mode, &error))
            ancestor = fileManager->openDirectoryAtURL(trustedAncestor, &error);
        if (ancestor)
            directory =
                fileManager->createDirectoryBeneath(ancestor.get(), relative, mode, owner, protectionClass, path, &error);
        created = static_cast<bool>(directory);
        identified = created && fstat(directory.get(), &made) == 0;
    }
    if (identified)
        MadeDirectories::shared().remember(path.native(), {made.st_dev, made.st_ino, owner, protectionClass});
    else
        MadeDirectories::shared().forget(path.native());
    if (!created)
        STW_LOG_ERROR(STWLogCategory::Unspecified, failureMessage, path, error);
}

bool STWLayoutDirectoryIsInPlace(const std::filesystem::path& path, uid_t owner, int32_t protectionClass,
                                 const std::filesystem::path& trustedAncestor) {
    auto made = MadeDirectories::shared().find(path.native());
    if (!made || made->owner != owner || made->protectionClass != protectionClass)
        return false;
    std::filesystem::path relative = relativeBelow(path, trustedAncestor);
    struct stat st;
    if (relative.empty()) {
        if (lstat(path.c_str(), &st) != 0)
            return false;
    } else {
        // Below the ancestor its owner may have put a link anywhere on the way, also where
        // it leads back to the directory made: the check does not follow one either.
        STWFileDescriptor ancestor(open(trustedAncestor.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
        STWFileDescriptor directory;
        if (ancestor)
            directory = STWFileManager::defaultManager()->openBeneath(ancestor.get(), relative.native(),
                                                                      O_PATH | O_DIRECTORY, 0,
                                                                      STWOpenBeneathNoSymlinks);
        if (!directory || fstat(directory.get(), &st) != 0)
            return false;
    }
    return S_ISDIR(st.st_mode) && st.st_dev == made->device && st.st_ino == made->inode &&
           (owner == STWFileManagerOwnerUnchanged || (st.st_uid == owner && st.st_gid == owner));
}

std::filesystem::path STWTrustedAncestorForClass(const STWUserIdentityRef& userIdentity,
                                                 STWContainerClass containerClass) {
    if (!userIdentity || !STWContainerClassIsPerUser(containerClass))
        return {};
    return userIdentity->homeDirectoryURL();
}

std::shared_ptr<STWGlobalConfiguration> STWGlobalConfiguration::sharedInstance() {
    static const std::shared_ptr<STWGlobalConfiguration> instance = std::make_shared<STWGlobalConfiguration>();
    return instance;
}

STWGlobalConfiguration::STWGlobalConfiguration() {
    _homeDirectory = underRoot("/private/var/root/");
    std::string name = STWPlatformConfiguration::sharedInstance()->mobileUserName();
    if (auto mobile = STWUserDatabase::userWithName(name)) {
        _currentMobileUserId = mobile->uid;
        _currentMobileGroupId = mobile->gid;
        STW_LOG_NOTICE(STWLogCategory::Unspecified, "Current mobile user ID is %u, group ID is %u", _currentMobileUserId,
                       _currentMobileGroupId);
    } else {
        STW_LOG_ERROR(STWLogCategory::Unspecified, "Failed to get mobile uid. This is bad");
    }
}

template <class Compute>
std::filesystem::path STWGlobalConfiguration::_directory(std::optional<std::filesystem::path>& slot, Compute&& compute,
                                                         uint16_t mode, uid_t owner, int32_t protectionClass,
                                                         const char* failureMessage) {
    // The lock is recursive: computing a path asks the parent accessor, which takes it again.
    std::lock_guard guard(_lock);
    if (slot && STWLayoutDirectoryIsInPlace(*slot, owner, protectionClass))
        return *slot;
    slot = compute();
    STWCreateLayoutDirectory(*slot, mode, owner, protectionClass, failureMessage);
    return *slot;
}

std::filesystem::path STWGlobalConfiguration::homeDirectory() {
    std::lock_guard guard(_lock);
    return *_homeDirectory;
}

std::filesystem::path STWGlobalConfiguration::sharedContainersDirectory() {
    return _directory(
        _sharedContainersDirectory, [] { return underRoot("/private/var/containers"); }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create shared container dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::bundleDirectory() {
    return _directory(
        _bundleDirectory, [this] { return sharedContainersDirectory() / "Bundle"; }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create bundle dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::transientBundleDirectory() {
    return _directory(
        _transientBundleDirectory, [this] { return sharedContainersDirectory() / "Temp"; }, kDirectoryMode,
        installationUID(), kLeaveProtectionClass, "Failed to create transient bundle dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::cachesDirectory() {
    return _directory(
        _cachesDirectory, [this] { return homeDirectory() / "Library/Caches/com.vorlane.stowlyd"; }, kDirectoryMode,
        0, kNoProtectionClass, "Failed to create cache dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::stagingDirectory() {
    return _directory(
        _stagingDirectory, [this] { return cachesDirectory() / "Staging"; }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create staging dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::deathrowDirectory() {
    return _directory(
        _deathrowDirectory, [this] { return cachesDirectory() / "Dead"; }, kDirectoryMode, 0, kLeaveProtectionClass,
        "Failed to create deathrow dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::transientDirectory() {
    return _directory(
        _transientDirectory, [this] { return cachesDirectory() / "Temp"; }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create transient dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::libraryDirectory() {
    return _directory(
        _libraryDirectory, [this] { return homeDirectory() / "Library/Stowly"; }, kDirectoryMode, 0,
        kNoProtectionClass, "Failed to create library dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::replaceDirectory() {
    return _directory(
        _replaceDirectory, [this] { return libraryDirectory() / "Replace"; }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create replace dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::pendingUpdatesDirectory() {
    return _directory(
        _pendingUpdatesDirectory, [this] { return libraryDirectory() / "PendingUpdates"; }, kDirectoryMode, 0,
        kLeaveProtectionClass, "Failed to create updates dir at \"%@\": %@");
}

std::filesystem::path STWGlobalConfiguration::logDirectory() {
    std::lock_guard guard(_lock);
    std::filesystem::path path = homeDirectory() / "Library/Logs/Stowly";
    if (!STWLayoutDirectoryIsInPlace(path, 0, kNoProtectionClass))
        STWCreateLayoutDirectory(path, kDirectoryMode, 0, kNoProtectionClass,
                                 "Failed to create log directory at \"%@\": %@");
    return path;
}

std::shared_ptr<const STWGlobalConfiguration::OpenDirectory>
STWGlobalConfiguration::openDeathrowDirectory(STWErrorRef* error) {
    std::lock_guard guard(_lock);
    struct stat st;
    if (_openDeathrowDirectory && fstat(_openDeathrowDirectory->fd.get(), &st) == 0 && st.st_nlink > 0)
        return _openDeathrowDirectory;
    // Root's own directory below root's: opened as its path says.
    std::filesystem::path url = deathrowDirectory();
    STWFileDescriptor fd = STWFileManager::defaultManager()->openDirectoryAtURL(url, error);
    if (!fd)
        return nullptr;
    _openDeathrowDirectory = std::make_shared<const OpenDirectory>(OpenDirectory{url, std::move(fd)});
    return _openDeathrowDirectory;
}

std::optional<std::filesystem::path> STWGlobalConfiguration::legacyTransientBundleDirectory() {
    std::filesystem::path path = underRoot("/private/var/setwrightd/Library/Caches/com.vorlane.stowlyd");
    if (!STWFileManager::defaultManager()->itemExistsAtURL(path))
        return std::nullopt;
    return path;
}

std::shared_ptr<STWPerUserConfiguration>
STWGlobalConfiguration::getPerUserConfigurationForUserIdentity(const STWUserIdentityRef& identity) {
    std::lock_guard guard(_lock);
    auto& slot = _perUserConfigurations[identity->identifier()];
    if (!slot)
        slot = std::make_shared<STWPerUserConfiguration>(identity);
    return slot;
}

std::optional<std::filesystem::path> STWGlobalConfiguration::globalContainerBaseURLWithContentClass(
    STWContainerClass contentClass, bool transient) {
    std::string_view name = STWContainerClassDirectoryName(contentClass);
    if (STWContainerClassIsBundle(contentClass))
        return (transient ? transientBundleDirectory() : sharedContainersDirectory()) / name;
    if (STWContainerClassIsSystem(contentClass))
        return (transient ? transientDirectory() : sharedContainersDirectory()) / name;
    return std::nullopt;
}

std::optional<std::filesystem::path> STWGlobalConfiguration::containerDirectoryURLForUserIdentity(
    const STWUserIdentityRef& identity, STWContainerClass contentClass, bool transient) {
    std::lock_guard guard(_lock); // global before per-user
    if (auto base = globalContainerBaseURLWithContentClass(contentClass, transient)) {
        uid_t owner = STWContainerClassIsBundle(contentClass) ? installationUID() : systemContainerUID();
        if (!STWLayoutDirectoryIsInPlace(*base, owner, kLeaveProtectionClass))
            STWCreateLayoutDirectory(*base, kDirectoryMode, owner, kLeaveProtectionClass,
                                     "Failed to create container dir at \"%@\": %@");
        return base;
    }
    return getPerUserConfigurationForUserIdentity(identity)->containerDirectoryURLForContentClass(contentClass,
                                                                                                 transient);
}

std::filesystem::path STWGlobalConfiguration::stagingDirectoryURLForUserIdentity(const STWUserIdentityRef& identity,
                                                                                 STWContainerClass contentClass) {
    if (STWContainerClassIsPerUser(contentClass))
        return getPerUserConfigurationForUserIdentity(identity)->stagingDirectory();
    return stagingDirectory();
}

const std::vector<std::string>& STWGlobalConfiguration::appUserDataItemNames() {
    static const std::vector<std::string> names{"Documents", "Library", "tmp", "StoreKit"};
    return names;
}

const std::vector<std::string>& STWGlobalConfiguration::excludedFromAppUserData() {
    static const std::vector<std::string> names{"SystemData"};
    return names;
}

bool STWGlobalConfiguration::migrationFileExistsWithName(const std::string& name) {
    return STWFileManager::defaultManager()->itemExistsAtURL(libraryDirectory() / name);
}

bool STWGlobalConfiguration::isInternalImage() {
    std::lock_guard guard(_lock);
    if (!_isInternalImage)
        _isInternalImage = STWPlatformConfiguration::sharedInstance()->isInternalImage();
    return *_isInternalImage;
}

int STWGlobalConfiguration::diskLogLevel() { return isInternalImage() ? 4 : 1; }

void STWGlobalConfiguration::setIsInternalImage(bool internal) {
    std::lock_guard guard(_lock);
    _isInternalImage = internal;
}
