// Services on one existing container: info values, a fresh UUID directory, disk usage, the
// private assets directory of an app and the removal of its assets, content staged in a
// system group container, and the retry self-test.
//
// The container belongs to its app, which may put links, FIFOs and hard links anywhere in
// it and swap a directory for a link at any moment. So nothing below the container
// directory is named by a path string: the directory is opened beneath its class
// directory (STWMetadata::openContainerDirectory), everything below it beneath that
// descriptor (openat2 with RESOLVE_BENEATH), and the renames and mode changes act on
// what was opened.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/FileSystem/STWFileSystemPrimitives.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Lifecycle/STWTestLocks.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/STWLocks.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

namespace fs = std::filesystem;
using STWFileSystemPrimitives::currentPathOfDescriptor;
using STWFileSystemPrimitives::sameItem;

namespace {

constexpr const char* kStaticDiskUsageKey = "com.vorlane.Setwright.StaticDiskUsage";
constexpr const char* kCrashCounterKey = "CrashCounter";
constexpr const char* kUserManagedAssetsPrefix = "com.vorlane.UserManagedAssets.";

// True when `path` lies strictly below `directory`, compared component by component, so
// that "Assets.abc2" is not taken for a child of "Assets.abc".
bool isStrictlyBelow(const fs::path& path, const fs::path& directory) {
    auto p = path.begin(), d = directory.begin();
    for (; d != directory.end(); ++d, ++p)
        if (p == path.end() || *p != *d)
            return false;
    return p != path.end();
}

// A relative path split into the directory that holds its last component and that
// component; nullopt for a path without a last name ("", ".", "a/..", "a/").
std::optional<std::pair<std::string, std::string>> splitLastComponent(const std::string& relativePath) {
    fs::path path(relativePath);
    std::string name = path.filename();
    if (name.empty() || name == "." || name == "..")
        return std::nullopt;
    std::string parent = path.parent_path();
    return std::pair{parent.empty() ? std::string(".") : parent, name};
}

std::string randomSuffix() {
    static constexpr char alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789";
    unsigned char bytes[6] = {};
    if (getrandom(bytes, sizeof bytes, 0) != static_cast<ssize_t>(sizeof bytes))
        throw std::system_error(errno, std::generic_category(), "getrandom");
    std::string suffix;
    for (unsigned char b : bytes)
        suffix += alphabet[b % (sizeof alphabet - 1)];
    return suffix;
}

} // namespace

bool STWClientConnection::setInfoValue(const std::optional<STWValue>& value, const STWValue& forKey,
                                       const STWConcreteContainerIdentityRef& containerIdentity, bool useLocking,
                                       uint64_t* error) {
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        const std::string* key = forKey.string();
        if (!key) {
            STW_ERROR(STWErrorInvalidArgument, nullptr, "Info key %@ is missing or not a string", forKey.description());
            *error = STWErrorInvalidArgument;
            return false;
        }
        std::optional<STWIdentifierLockGuard> lock;
        if (useLocking)
            lock.emplace(containerIdentity->uuid().string(), STWLockMode::Writing);
        auto cache = STWContainerCache::sharedInstance();
        STWMetadataRef found = cache->containerForContainerIdentity(containerIdentity);
        if (!found) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", containerIdentity);
            *error = STWErrorNotFound;
            return false;
        }
        auto record = std::make_shared<STWMetadata>(*found);
        STWValue::Dictionary info = record->info().value_or(STWValue::Dictionary{});
        if (value && !value->isNull())
            info[*key] = *value;
        else
            info.erase(*key);
        record->setInfo(std::move(info));
        STWErrorRef stepError;
        if (!record->writeMetadataToDiskWithError(&stepError)) {
            *error = STWDaemonCodeOfError(stepError, STWErrorWriteFileFailed);
            return false;
        }
        if (!cache->addContainerMetadata(record, record->url(), record->transient(), false, &stepError)) {
            STW_ERROR(STWErrorCacheAddFailed, stepError, "Failed to add to cache: %@, url: %@, transient: %d", record,
                      record->url(), record->transient() ? 1 : 0);
            *error = STWErrorCacheAddFailed;
            return false;
        }
        return true;
    });
}

std::optional<STWValue> STWClientConnection::infoValueForKey(const STWValue& key,
                                                             const STWConcreteContainerIdentityRef& containerIdentity,
                                                             bool useLocking, uint64_t* error) {
    return _catchingExceptions<std::optional<STWValue>>(__func__, error, std::nullopt, [&]() -> std::optional<STWValue> {
        const std::string* name = key.string();
        if (!name) {
            STW_ERROR(STWErrorInvalidArgument, nullptr, "Info key %@ is missing or not a string", key.description());
            *error = STWErrorInvalidArgument;
            return std::nullopt;
        }
        std::optional<STWIdentifierLockGuard> lock;
        if (useLocking)
            lock.emplace(containerIdentity->uuid().string(), STWLockMode::Reading);
        STWMetadataRef found = STWContainerCache::sharedInstance()->containerForContainerIdentity(containerIdentity);
        if (!found) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", containerIdentity);
            *error = STWErrorNotFound;
            return std::nullopt;
        }
        const STWValue* value = found->info() ? STWDictionaryFind(*found->info(), *name) : nullptr;
        if (!value) {
            STW_ERROR_NOLOG(STWErrorInfoValueNotFound, nullptr, "Didn't find info value for key: %@", *name);
            *error = STWErrorInfoValueNotFound;
            return std::nullopt;
        }
        return *value;
    });
}

bool STWClientConnection::regenerateDirectoryUUIDWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                                       uint64_t* error) {
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        // The set of container directories changes: nobody may look one up meanwhile.
        STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
        auto cache = STWContainerCache::sharedInstance();
        STWMetadataRef found = cache->containerForContainerIdentity(identity);
        if (!found) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", identity);
            *error = STWErrorNotFound;
            return false;
        }
        fs::path from = found->url();
        std::string name = from.filename();
        if (!STWUUID::fromString(name)) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "Non-UUID last path component: %@ for %@", name, identity);
            *error = STWErrorInvalidClass;
            return false;
        }
        std::string newName = STWUUID::random().string();
        fs::path to = from.parent_path() / newName;
        // The container directory is the daemon's entry in its class directory; the rename
        // goes through the class directory's descriptor and moves only the directory that
        // holds this record's metadata file.
        STWErrorRef stepError;
        STWFileDescriptor classfd;
        STWFileDescriptor containerfd = found->openContainerDirectory(&stepError, &classfd);
        if (!containerfd || !STWFileManager::defaultManager()->moveDirectoryAt(
                                classfd.get(), name, classfd.get(), newName, containerfd.get(),
                                STWFileManagerMoveSyncDirectories, from, to, &stepError)) {
            STW_ERROR(STWErrorMoveToNewUUIDFailed, stepError, "Failed to move dir: %@ to new UUID dir: %@", from, to);
            *error = STWErrorMoveToNewUUIDFailed;
            return false;
        }
        auto record = std::make_shared<STWMetadata>(*found);
        record->setUrl(to);
        if (!cache->addContainerMetadata(record, to, record->transient(), true, &stepError)) {
            STW_ERROR(STWErrorCacheAddFailed, stepError, "Failed to add to cache: %@, url: %@, transient: %d", record,
                      to, record->transient() ? 1 : 0);
            *error = STWErrorCacheAddFailed;
            return false;
        }
        return true;
    });
}

uint64_t STWClientConnection::diskUsageWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                             uint64_t* error) {
    return _catchingExceptions<uint64_t>(__func__, error, 0, [&]() -> uint64_t {
        bool fastSizing = STWPlatformConfiguration::sharedInstance()->isFeatureEnabled("fast_container_sizing");
        STWMetadataRef found;
        std::optional<uint64_t> cached;
        {
            STWIdentifierLockGuard lock(identity->uuid().string(), STWLockMode::Reading);
            found = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity);
            if (!found) {
                STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", identity);
                *error = STWErrorNotFound;
                return 0;
            }
            if (STWContainerClassIsBundle(found->containerClass())) {
                uint64_t code = STWErrorSuccess;
                auto value = infoValueForKey(STWValue(kStaticDiskUsageKey), identity, false, &code);
                if (value)
                    cached = value->uint64Value();
                else if (code != STWErrorInfoValueNotFound)
                    STW_LOG_ERROR(STWLogCategory::Lifecycle, "Error looking up info value for identity: %@: %llu",
                                  identity, code);
            }
        }
        if (cached)
            return *cached;
        STWTestLocks::sharedInstance()->waitOnLock(2);
        // Measured without a lock: an app's tree may be large, and nobody waits for it.
        STWErrorRef openError;
        STWFileDescriptor containerfd = found->openContainerDirectory(&openError);
        if (!containerfd) {
            STW_ERROR(STWErrorNotFound, openError, "No Container with identity: %@", identity);
            *error = STWErrorNotFound;
            return 0;
        }
        uint64_t size = STWFileManager::defaultManager()->fastDiskUsageForURL(found->url(), containerfd.get());
        // A bundle never changes once installed: its size is kept. 0 is a walk that failed
        // (a container holds at least its metadata file), not a size.
        if (!fastSizing && size != 0 && STWContainerClassIsBundle(found->containerClass())) {
            uint64_t code = STWErrorSuccess;
            if (!setInfoValue(STWValue(size), STWValue(kStaticDiskUsageKey), identity, true, &code))
                STW_LOG_ERROR(STWLogCategory::Lifecycle, "Error setting info value for identity: %@: %llu", identity,
                              code);
        }
        return size;
    });
}

std::optional<std::string> STWClientConnection::userManagedAssetsPathWithContainerIdentity(
    const STWContainerIdentityRef& identity, bool isRelative, bool createIfNecessary, bool* existed, uint64_t* error) {
    return _catchingExceptions<std::optional<std::string>>(__func__, error, std::nullopt, [&]() -> std::optional<std::string> {
        std::optional<std::string> client = clientBundleIdentifier();
        if (!entitled() && client != identity->identifier()) {
            STW_ERROR(STWErrorInvalidArgument, nullptr, "%@ trying to retrieve path for identifier: %@ without entitlement",
                      client ? STWFormatArg(*client) : STWFormatArg(nullptr), identity->identifier());
            *error = STWErrorInvalidArgument;
            return std::nullopt;
        }
        auto cache = STWContainerCache::sharedInstance();
        STWErrorRef stepError;
        STWMetadataRef found = cache->containerForContainerIdentity(identity, false, true, &stepError);
        if (!found) {
            STW_ERROR(STWErrorInvalidClass, stepError,
                      "Failed to create app data container for user managed assets path for %@: %@", identity, stepError);
            *error = STWErrorInvalidClass;
            return std::nullopt;
        }
        if (found->urlString().empty()) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "No URL in container metadata object: %@", found);
            *error = STWErrorInvalidClass;
            return std::nullopt;
        }
        STWConcreteContainerIdentityRef concrete = found->containerIdentity();
        STWIdentifierLockGuard lock(concrete->uuid().string(), STWLockMode::Writing);
        // The record as it is now that no other assets request can change it.
        found = cache->containerForContainerIdentity(concrete);
        if (!found) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", concrete);
            *error = STWErrorNotFound;
            return std::nullopt;
        }
        fs::path library = found->url() / "Library";
        STWFileDescriptor containerfd = found->openContainerDirectory(&stepError);
        STWFileDescriptor libraryfd;
        if (containerfd)
            libraryfd = STWFileManager::defaultManager()->openBeneath(containerfd.get(), "Library", O_RDONLY | O_DIRECTORY,
                                                                      0, STWOpenBeneathNoSymlinks, &stepError);
        if (!libraryfd) {
            STW_ERROR(STWErrorCreateSubdirectoryFailed, stepError, "Failed to create user managed assets dir at %@: %@",
                      library, stepError);
            *error = STWErrorCreateSubdirectoryFailed;
            return std::nullopt;
        }
        auto answer = [&](const std::string& name) {
            return isRelative ? (fs::path("Library") / name).native() : (library / name).native();
        };
        if (const auto& name = found->userManagedAssetsDirName()) {
            struct stat st;
            // Only the directory the daemon made counts; a link or a file the app put in its
            // place is not handed out.
            if (fstatat(libraryfd.get(), name->c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(st.st_mode)) {
                *existed = true;
                return answer(*name);
            }
        }
        if (!createIfNecessary) {
            STW_ERROR_NOLOG(STWErrorUserManagedPathNotFound, nullptr, "User managed path for %@:%@ Not Found",
                            identity->identifier(), identity->userIdentity());
            *error = STWErrorUserManagedPathNotFound;
            return std::nullopt;
        }
        auto fileManager = STWFileManager::defaultManager();
        std::string name;
        STWFileDescriptor assetsfd;
        for (int attempt = 0; attempt < 8 && !assetsfd; ++attempt) {
            name = kUserManagedAssetsPrefix + randomSuffix();
            assetsfd = fileManager->createNewDirectoryAt(libraryfd.get(), name, 0755, STWFileManagerOwnerUnchanged,
                                                         STWFileManagerClassUnchanged, library / name, &stepError);
            if (!assetsfd && !(stepError && stepError->isPOSIX(EEXIST)))
                break;
        }
        if (!assetsfd) {
            STW_ERROR(STWErrorCreateSubdirectoryFailed, stepError, "Failed to create user managed assets dir at %@: %@",
                      library, stepError);
            *error = STWErrorCreateSubdirectoryFailed;
            return std::nullopt;
        }
        fs::path assets = library / name;
        if (fchmod(assetsfd.get(), 0755) != 0) {
            STW_ERROR(STWErrorCreateSubdirectoryFailed, nullptr, "Failed to chmod user managed assets dir at %@: %s",
                      assets, strerror(errno));
            *error = STWErrorCreateSubdirectoryFailed;
            return std::nullopt;
        }
        STWContainerClass c = found->containerClass();
        if (fchown(assetsfd.get(), found->userIdentity()->posixUIDForContainerClass(c),
                   found->userIdentity()->posixGIDForContainerClass(c)) != 0) {
            STW_ERROR(STWErrorCreateSubdirectoryFailed, nullptr, "Failed to chown user managed assets dir at %@: %s",
                      assets, strerror(errno));
            *error = STWErrorCreateSubdirectoryFailed;
            return std::nullopt;
        }
        auto record = std::make_shared<STWMetadata>(*found);
        record->setUserManagedAssetsDirName(name);
        if (!record->writeMetadataToContainerDirectory(containerfd.get(), &stepError)) {
            *error = STWDaemonCodeOfError(stepError, STWErrorWriteFileFailed);
            return std::nullopt;
        }
        if (!cache->addContainerMetadata(record, record->url(), record->transient(), false, &stepError)) {
            STW_ERROR(STWErrorCacheAddFailed, stepError, "Failed to add to cache: %@, url: %@, transient: %d", record,
                      record->url(), record->transient() ? 1 : 0);
            *error = STWErrorCacheAddFailed;
            return std::nullopt;
        }
        *existed = false;
        return answer(name);
    });
}

bool STWClientConnection::deleteUserManagedAssetWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                      const std::optional<std::string>& relativePath,
                                                                      uint64_t* error) {
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        if (!identity || !relativePath) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "Can't act on invalid input: ID: %@, Path: %@",
                      identity ? STWFormatArg(identity->identifier()) : STWFormatArg(nullptr),
                      relativePath ? STWFormatArg(*relativePath) : STWFormatArg(nullptr));
            *error = STWErrorInvalidClass;
            return false;
        }
        auto cache = STWContainerCache::sharedInstance();
        STWErrorRef stepError;
        STWMetadataRef found = cache->containerForContainerIdentity(identity, false, true, &stepError);
        if (!found) {
            STW_ERROR(STWErrorInvalidClass, stepError,
                      "Failed to create app data container for user managed assets path for %@: %@", identity, stepError);
            *error = STWErrorInvalidClass;
            return false;
        }
        STWConcreteContainerIdentityRef concrete = found->containerIdentity();
        STWIdentifierLockGuard lock(concrete->uuid().string(), STWLockMode::Writing);
        found = cache->containerForContainerIdentity(concrete);
        if (!found || found->urlString().empty() || !found->userManagedAssetsDirName()) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "No userManagedAssetsDirName or URL in container metadata object: %@",
                      found);
            *error = STWErrorInvalidClass;
            return false;
        }
        std::string assetsRelative = "Library/" + *found->userManagedAssetsDirName();
        fs::path assets = found->url() / assetsRelative;
        fs::path asset = assets / *relativePath;
        auto fileManager = STWFileManager::defaultManager();
        auto unresolvable = [&](const fs::path& path) {
            STW_ERROR(STWErrorInvalidPath, stepError, "Unable to get realpath for resource %@", path);
            *error = STWErrorInvalidPath;
            return false;
        };
        // The assets directory itself is the daemon's: no link on the way to it.
        STWFileDescriptor containerfd = found->openContainerDirectory(&stepError);
        STWFileDescriptor assetsfd;
        if (containerfd)
            assetsfd = fileManager->openBeneath(containerfd.get(), assetsRelative, O_RDONLY | O_DIRECTORY, 0,
                                                STWOpenBeneathNoSymlinks, &stepError);
        if (!assetsfd)
            return unresolvable(assets);
        // Below it the app's links are followed as long as they stay inside; one that leads
        // out fails to resolve. O_PATH opens nothing, so a FIFO does not block.
        STWFileDescriptor itemfd = fileManager->openBeneath(assetsfd.get(), *relativePath, O_PATH, 0,
                                                            STWOpenBeneathDefault, &stepError);
        if (!itemfd)
            return unresolvable(asset);
        struct stat assetsStat, itemStat;
        if (fstat(assetsfd.get(), &assetsStat) != 0 || fstat(itemfd.get(), &itemStat) != 0)
            return unresolvable(asset);
        if (sameItem(assetsStat, itemStat)) {
            STW_ERROR(STWErrorInvalidPath, nullptr, "Illegal attempt to delete user managed assets directory at %@",
                      assets);
            *error = STWErrorInvalidPath;
            return false;
        }
        std::optional<fs::path> assetsReal = currentPathOfDescriptor(assetsfd.get());
        std::optional<fs::path> itemReal = currentPathOfDescriptor(itemfd.get());
        if (!assetsReal || !itemReal)
            return unresolvable(asset);
        if (!isStrictlyBelow(*itemReal, *assetsReal)) {
            STW_ERROR(STWErrorInvalidPath, nullptr,
                      "Illegal attempt to delete asset not residing in user managed assets directory %@", assets);
            *error = STWErrorInvalidPath;
            return false;
        }
        // The resolved item is moved by its parent's descriptor and its own name, and only
        // while that entry is still the item resolved.
        fs::path resolved = itemReal->lexically_relative(*assetsReal);
        std::string parent = resolved.parent_path().empty() ? std::string(".") : resolved.parent_path().native();
        std::string name = resolved.filename();
        STWFileDescriptor parentfd = fileManager->openBeneath(assetsfd.get(), parent, O_RDONLY | O_DIRECTORY, 0,
                                                              STWOpenBeneathNoSymlinks, &stepError);
        struct stat entry;
        if (!parentfd || fstatat(parentfd.get(), name.c_str(), &entry, AT_SYMLINK_NOFOLLOW) != 0 ||
            !sameItem(entry, itemStat))
            return unresolvable(asset);
        if (!_moveItemAtToDeathRow(parentfd.get(), name, itemfd.get(), assets / resolved, &stepError)) {
            STW_ERROR(STWErrorItemOperationFailed, stepError, "Failed to remove asset at %@", assets / resolved);
            *error = STWErrorItemOperationFailed;
            return false;
        }
        return true;
    });
}

std::optional<fs::path> STWClientConnection::stageSharedContentForIdentifier(const STWValue& identifier,
                                                                            const STWValue& sourceRelativePath,
                                                                            const STWValue& destRelativePath,
                                                                            uint64_t* error) {
    return _catchingExceptions<std::optional<fs::path>>(__func__, error, std::nullopt, [&]() -> std::optional<fs::path> {
        auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(
            STWUserIdentityCache::defaultUserIdentity(), identifier, STWContainerClassSharedSystemGroup, error);
        if (!identity)
            return std::nullopt;
        const std::string* source = sourceRelativePath.string();
        const std::string* dest = destRelativePath.string();
        if (!identifier.string() || !source || !dest) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "Can't act on invalid input: ID: %@, source: %@, dest: %@",
                      identifier.description(), sourceRelativePath.description(), destRelativePath.description());
            *error = STWErrorInvalidClass;
            return std::nullopt;
        }
        if (containsDotDotPathComponents(*source) || containsDotDotPathComponents(*dest)) {
            STW_ERROR(STWErrorInvalidArgument, nullptr, "Paths can't contain dots. source: %@, dest: %@", *source, *dest);
            *error = STWErrorInvalidArgument;
            return std::nullopt;
        }
        const std::string& group = identity->identifier();
        std::optional<std::string> client = clientBundleIdentifier();
        auto mapping = STWCodeSigningMapping::sharedInstance();
        auto entitled = mapping && client ? mapping->systemGroupIdentifiersForIdentifier(*client) : std::nullopt;
        if (!entitled || std::find(entitled->begin(), entitled->end(), group) == entitled->end()) {
            STW_ERROR(STWErrorNotEntitled, nullptr, "%@ not entitled for system group container %@",
                      client ? STWFormatArg(*client) : STWFormatArg(nullptr), group);
            *error = STWErrorNotEntitled;
            return std::nullopt;
        }
        auto cache = STWContainerCache::sharedInstance();
        STWErrorRef stepError;
        STWMetadataRef found = cache->containerForContainerIdentity(identity, false, true, &stepError);
        if (!found) {
            STW_ERROR(STWErrorNotFound, stepError, "System group container with identifier %@ not found: %@", group,
                      stepError);
            *error = STWErrorNotFound;
            return std::nullopt;
        }
        STWIdentifierLockGuard lock(found->containerIdentity()->uuid().string(), STWLockMode::Writing);
        fs::path container = found->url();
        auto invalid = [&](const char* which, const std::string& relative) {
            STW_ERROR(STWErrorInvalidPath, stepError, "Invalid %s URL %@ for %@ at %@", which, container / relative,
                      group, container);
            *error = STWErrorInvalidPath;
            return std::nullopt;
        };
        auto fileManager = STWFileManager::defaultManager();
        STWFileDescriptor containerfd = found->openContainerDirectory(&stepError);
        if (!containerfd)
            return invalid("source", *source);
        // Both parents resolved beneath the container (its own links are followed as long as
        // they stay inside); the two last names are entries of those parents.
        auto openParent = [&](const std::optional<std::pair<std::string, std::string>>& parts) {
            return parts ? fileManager->openBeneath(containerfd.get(), parts->first, O_RDONLY | O_DIRECTORY, 0,
                                                    STWOpenBeneathDefault, &stepError)
                         : STWFileDescriptor();
        };
        auto sourceParts = splitLastComponent(*source);
        STWFileDescriptor sourceParent = openParent(sourceParts);
        // Only a directory or a file of its own is staged: it is opened (never a FIFO or a
        // link), and a file with other names could be anybody's.
        struct stat st;
        STWFileDescriptor item;
        if (sourceParent && fstatat(sourceParent.get(), sourceParts->second.c_str(), &st, AT_SYMLINK_NOFOLLOW) == 0 &&
            (S_ISDIR(st.st_mode) || (S_ISREG(st.st_mode) && st.st_nlink == 1)))
            item.reset(openat(sourceParent.get(), sourceParts->second.c_str(),
                              O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        struct stat opened;
        if (!item || fstat(item.get(), &opened) != 0 || !sameItem(opened, st))
            return invalid("source", *source);
        auto destParts = splitLastComponent(*dest);
        STWFileDescriptor destParent = openParent(destParts);
        std::optional<fs::path> destParentPath = destParent ? currentPathOfDescriptor(destParent.get()) : std::nullopt;
        if (!destParentPath)
            return invalid("dest", *dest);
        fs::path from = container / *source;
        fs::path to = *destParentPath / destParts->second;
        // The tree is the app's no longer: the walk acts on the descriptor just opened.
        if (!fileManager->standardizeACLsAt(item.get(), from, false, &stepError)) {
            STW_ERROR(STWErrorSetACLFailed, stepError, "Failed to standardize ACLs for %@ at %@: %@", group, from,
                      stepError);
            *error = STWErrorSetACLFailed;
            return std::nullopt;
        }
        if (!fileManager->moveDirectoryAt(sourceParent.get(), sourceParts->second, destParent.get(), destParts->second,
                                          item.get(), STWFileManagerMoveSyncDirectories, from, to, &stepError)) {
            STW_ERROR(STWErrorMoveFailed, stepError, "Failed move for %@ from %@ to: %@: %@", group, from, to,
                      stepError);
            *error = STWErrorMoveFailed;
            return std::nullopt;
        }
        return to;
    });
}

bool STWClientConnection::retryTestWithNumCrashes(uint64_t numCrashes, uint64_t* error) {
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        // The test container is the daemon's own, made whoever asks.
        STWClientConnection privileged;
        uint64_t code = STWErrorSuccess;
        auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(
            _userIdentityCache->userIdentityForPersonalPersona(), "com.vorlane.retryTest", STWContainerClassDataApplication,
            &code);
        auto container =
            identity ? privileged.createOrLookupContainerWithContainerIdentity(identity, true, false, true, &code)
                     : nullptr;
        if (!container) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle,
                          "Failed to create or lookup lookup existing container for retry test: %@", code);
            *error = code;
            return false;
        }
        STWConcreteContainerIdentityRef concrete = container->containerIdentity();
        uint64_t lookupCode = STWErrorSuccess;
        auto stored = infoValueForKey(STWValue(kCrashCounterKey), concrete, true, &lookupCode);
        std::optional<uint64_t> counter = stored ? stored->uint64Value() : std::nullopt;
        uint64_t remaining = counter ? (*counter ? *counter - 1 : 0) : numCrashes;
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Crashes Remaining in retry test: %llu", remaining);
        uint64_t storeCode = STWErrorSuccess;
        bool storedCounter = setInfoValue(STWValue(remaining), STWValue(kCrashCounterKey), concrete, true, &storeCode);
        // A crash the counter does not record would be repeated by every retry for ever.
        if (remaining != 0 && storedCounter) {
            STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Crashing");
            STWLog::flush();
            std::this_thread::sleep_for(std::chrono::seconds(2));
            _exit(0);
        }
        if (remaining == 0)
            _commandQueue->insertCommand(
                STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities({concrete}, true, nullptr));
        if (!storedCounter) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to delete retry container at : %@", container->url());
            *error = storeCode;
            return false;
        }
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Returning Successfully");
        return true;
    });
}
