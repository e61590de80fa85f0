#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Request/STWDaemon.h"
#include "Daemon/STWLocks.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWContainerLibrary.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWPlatformConfiguration.h"

#include <algorithm>

STWClientConnection::STWClientConnection()
    : _backgroundQueue(_sharedBackgroundQueue()), _entitled(true), _allowOtherIdLookup(false), _unrestricted(true),
      _clientIdentity(STWClientIdentity::anonymousPrivilegedClientIdentity()), _commandQueue(STWCommandQueue::init()),
      _userIdentityCache(STWUserIdentitySharedCache::sharedInstance()) {}

STWClientConnection::STWClientConnection(STWClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup,
                                         bool unrestricted, std::optional<STWValue::Dictionary> lookup,
                                         std::optional<STWValue::Array> entitledWipeIdentifiers,
                                         std::shared_ptr<STWCommandQueue> commandQueue)
    : _backgroundQueue(_sharedBackgroundQueue()), _entitled(entitled), _allowOtherIdLookup(allowOtherIdLookup),
      _unrestricted(unrestricted), _clientIdentity(std::move(clientIdentity)), _commandQueue(std::move(commandQueue)),
      _entitledWipeIdentifiers(std::move(entitledWipeIdentifiers)), _lookup(std::move(lookup)),
      _userIdentityCache(STWUserIdentitySharedCache::sharedInstance()) {}

const std::shared_ptr<STWClientConnection>& STWClientConnection::sharedClientConnection() {
    static const std::shared_ptr<STWClientConnection> shared = std::make_shared<STWClientConnection>();
    return shared;
}

std::shared_ptr<STWClientConnection>
STWClientConnection::privilegedClientConnectionWithUserIdentity(STWUserIdentityRef userIdentity) {
    return std::make_shared<STWClientConnection>(
        STWClientIdentity::privilegedClientIdentityWithUserIdentity(std::move(userIdentity)), true, true, true,
        std::nullopt, std::nullopt, STWCommandQueue::init());
}

const std::shared_ptr<STWQueue>& STWClientConnection::_sharedBackgroundQueue() {
    static const std::shared_ptr<STWQueue> queue = STWQueue::create(
        "com.vorlane.stowlyd.background", {.priority = STWQueue::Priority::Background, .holdsTransactions = true});
    return queue;
}

bool STWClientConnection::completeWithError(uint64_t* error) {
    return _commandQueue->executeAllUntilExhaustedOrError(error);
}

bool STWClientConnection::isEntitledForLookupWithClass(STWContainerClass containerClass, std::string_view identifier) {
    auto identifiers = _lookupForContainerClass(containerClass);
    return identifiers && identifiers->count(identifier) > 0;
}

std::optional<STWClientConnection::StringSet> STWClientConnection::_lookupForContainerClass(STWContainerClass containerClass) {
    std::string_view word = STWContainerClassLookupWord(containerClass);
    std::shared_ptr<std::map<std::string, StringSet, std::less<>>> sanitized;
    {
        std::lock_guard guard(_lock);
        if (word.empty() || !_lookup)
            return std::nullopt;
        if (!_sanitizedLookup)
            _sanitizedLookup = std::make_shared<std::map<std::string, StringSet, std::less<>>>();
        sanitized = _sanitizedLookup;
    }
    std::lock_guard guard(_sanitizedLookupLock);
    auto it = sanitized->find(word);
    if (it == sanitized->end()) {
        // A value that is not an array (a lone string, a number) allows nothing.
        const STWValue* value = STWDictionaryFind(*_lookup, word);
        StringSet identifiers = value && value->array() ? _setOfStringsFromArray(*value->array()) : StringSet();
        it = sanitized->emplace(std::string(word), std::move(identifiers)).first;
    }
    return it->second;
}

STWClientConnection::StringSet STWClientConnection::_setOfStringsFromArray(const STWValue::Array& array) {
    StringSet result;
    for (const STWValue& element : array)
        if (const std::string* s = element.string())
            result.insert(*s);
    return result;
}

std::optional<std::string> STWClientConnection::clientBundleIdentifier() const {
    if (!_clientIdentity)
        return std::nullopt;
    return _clientIdentity->bundleIdentifier();
}

void STWClientConnection::setClientBundleIdentifier(std::optional<std::string> identifier) {
    std::lock_guard guard(_lock);
    _clientBundleIdentifier = std::move(identifier);
}

std::optional<STWValue::Array> STWClientConnection::entitledWipeIdentifiers() const {
    std::lock_guard guard(_lock);
    return _entitledWipeIdentifiers;
}

void STWClientConnection::setEntitledWipeIdentifiers(std::optional<STWValue::Array> identifiers) {
    std::lock_guard guard(_lock);
    _entitledWipeIdentifiers = std::move(identifiers);
}

// Boot-time setup and cleanup of the container store (restored system containers,
// interrupted replace operations, pending protection changes, leftovers swept to death
// row) are not part of this build yet. These entry points keep the start-up order in
// place; they do no work and claim none.
void STWClientConnection::rebootStowlySetup() {
    STW_LOG_DEBUG(STWLogCategory::Startup, "First-boot setup has no steps in this build");
}

void STWClientConnection::stowlySetup() {
    STW_LOG_DEBUG(STWLogCategory::Startup, "Every-start setup has no steps in this build");
}

void STWClientConnection::rebootStowlyCleanupWithCompletion(std::function<void()> completion) {
    STW_LOG_DEBUG(STWLogCategory::Startup, "First-boot cleanup has no steps in this build");
    // With nothing to clean, the cleanup is over as soon as it ran; the completion still
    // marks the boot as seen and tells waiters.
    _backgroundQueue->async(std::move(completion));
}

void STWClientConnection::stowlyCleanupWithCompletion(std::function<void()> completion) {
    STW_LOG_DEBUG(STWLogCategory::Startup, "Every-start cleanup has no steps in this build");
    _backgroundQueue->async(std::move(completion));
}

// ---------------------------------------------------------------------------------------
// Creating and finding containers

namespace {

// Runs `body`, turning an exception into code 40 (an internal image stops instead, so the
// report is not lost).
template <class T>
T catchingExceptions(const char* function, uint64_t* error, T failure, const std::function<T()>& body) {
    try {
        return body();
    } catch (...) {
        STWErrorForCurrentException(function, __LINE__,
                                    STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage()));
        *error = STWErrorException;
        return failure;
    }
}

uint64_t codeOf(const STWErrorRef& error) {
    return error && error->domain() == STWErrorDomain ? static_cast<uint64_t>(error->code())
                                                      : uint64_t{STWErrorItemOperationFailed};
}

} // namespace

std::shared_ptr<STWMetadata> STWClientConnection::createOrLookupContainerWithContainerIdentity(
    const STWContainerIdentityRef& identity, bool createIfNecessary, bool transient, bool useLocking, uint64_t* error) {
    uint64_t ignored = STWErrorSuccess;
    uint64_t* code = error ? error : &ignored;
    return catchingExceptions<std::shared_ptr<STWMetadata>>(__func__, code, nullptr, [&]() -> std::shared_ptr<STWMetadata> {
        std::optional<std::string> client = clientBundleIdentifier();
        STWFormatArg clientArg = client ? STWFormatArg(*client) : STWFormatArg(nullptr);
        STW_LOG_DEBUG(STWLogCategory::Lifecycle,
                      "createOrLookup; identity: %@, createIfNecessary: %d, transient: %d, allowOtherIdLookup: %d, "
                      "unrestricted: %d, clientBundleIdentifier: %@",
                      identity, createIfNecessary ? 1 : 0, transient ? 1 : 0, allowOtherIdLookup() ? 1 : 0,
                      unrestricted() ? 1 : 0, clientArg);
        if (!identity) {
            STW_ERROR(STWErrorInvalidArgument, nullptr, "Cannot lookup a nil container identity.");
            *code = STWErrorInvalidArgument;
            return nullptr;
        }
        const std::string& id = identity->identifier();
        STWContainerClass c = identity->containerClass();
        STWWhitelistRef whitelist = STWWhitelist::sharedWhitelist();
        bool whitelisted = whitelist->isLookupWhitelistedFromCodeSignIdentifier(client.value_or(""), c, id);
        bool isGroup = c == STWContainerClassSharedAppGroup || c == STWContainerClassSharedSystemGroup;
        bool allowed = (client && *client == id) || allowOtherIdLookup() || (isGroup && allowGroupIdLookup()) ||
                       unrestricted() || isEntitledForLookupWithClass(c, id) || whitelisted;
        if (!allowed) {
            STW_ERROR(STWErrorNotEntitled, nullptr, "%@ not entitled to retrieve container class %ld with identifier %@",
                      clientArg, c, id);
            *code = STWErrorNotEntitled;
            return nullptr;
        }
        if (c == STWContainerClassDataSystem && !allowOtherIdLookup() && !unrestricted() &&
            !isEntitledForLookupWithClass(c, id)) {
            // The code-signing mapping that records which programs own a system container is
            // not part of this build: no identifier has one, so only the well-known list lets
            // such a caller through.
            bool hasSystemContainer = false;
            if (!whitelisted && !(hasSystemContainer && client && *client == id)) {
                STW_ERROR(STWErrorNotEntitled, nullptr, "%@ not entitled for system container with identifier %@",
                          clientArg, id);
                *code = STWErrorNotEntitled;
                return nullptr;
            }
        }

        auto cache = STWContainerCache::sharedInstance();
        if (!transient) {
            STWAllIdentifiersLockGuard lock(STWLockMode::Reading, useLocking);
            STWErrorRef lookupError;
            if (auto found = cache->containerForContainerIdentity(identity, false, true, &lookupError)) {
                auto result = std::make_shared<STWMetadata>(*found);
                result->setExisted(true);
                return result;
            }
            if (!lookupError || !lookupError->is(STWErrorNotFound)) {
                *code = codeOf(lookupError);
                return nullptr;
            }
        }
        if (!createIfNecessary) {
            STW_ERROR_NOLOG(STWErrorNotFound, nullptr, "Container with identifier: \"%@\" Not Found", id);
            *code = STWErrorNotFound;
            return nullptr;
        }

        STWAllIdentifiersLockGuard lock(STWLockMode::Writing, useLocking);
        STWErrorRef lookupError;
        if (auto found = cache->containerForContainerIdentity(identity, transient, true, &lookupError)) {
            if (!transient) {
                // Another request made it while we waited for the write lock.
                auto result = std::make_shared<STWMetadata>(*found);
                result->setExisted(true);
                return result;
            }
            STWErrorRef moveError;
            if (!_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
                STW_ERROR(STWErrorRemoveTransientFailed, moveError, "Failed to remove transient container at %@",
                          found->url());
                *code = STWErrorRemoveTransientFailed;
                return nullptr;
            }
        } else if (!lookupError || !lookupError->is(STWErrorNotFound)) {
            *code = codeOf(lookupError);
            return nullptr;
        }

        std::string name = STWUUID::random().string();
        STW_LOG_DEBUG(STWLogCategory::Lifecycle, "begin CreatingContainer uuid=%@ identifier=%@ class=%llu", name, id, c);
        const STWUserIdentityRef& userIdentity = identity->userIdentity();
        auto configuration = STWGlobalConfiguration::sharedInstance();
        auto fileManager = STWFileManager::defaultManager();
        std::filesystem::path stagingDirectory = configuration->stagingDirectoryURLForUserIdentity(userIdentity, c);
        std::filesystem::path staging = stagingDirectory / name;

        // The staging directory belongs to the user whose apps may swap its entries at any
        // moment: the new container is built only through the descriptor that made it, and
        // what the final rename publishes is checked to be that directory.
        STWErrorRef failure;
        uint64_t failureCode = STWErrorSuccess;
        std::shared_ptr<STWMetadata> metadata;
        auto fail = [&](uint64_t failedCode, STWErrorRef failedError) {
            failureCode = failedCode;
            failure = std::move(failedError);
        };
        STWErrorRef stepError;
        STWFileDescriptor stagingfd = fileManager->openDirectoryAtURL(stagingDirectory, &stepError);
        STWFileDescriptor containerfd;
        if (stagingfd)
            containerfd = _createTopLevelContainerDirectory(stagingfd.get(), name, staging, c,
                                                            userIdentity->posixUIDForContainerClass(c), &stepError);
        if (!containerfd) {
            fail(STWErrorCreateStagingFailed,
                 STW_ERROR(STWErrorCreateStagingFailed, stepError, "Failed to create staging dir at %@ : %@", staging,
                           stepError));
        } else {
            uint64_t identityError = STWErrorSuccess;
            auto concrete = STWConcreteContainerIdentity::containerIdentityWithUUID(STWUUID::random(), userIdentity, id,
                                                                                    c, &identityError);
            if (!concrete) {
                fail(identityError, nullptr);
            } else {
                metadata = std::make_shared<STWMetadata>(concrete, std::nullopt, staging, std::nullopt);
                if (!metadata->writeMetadataToContainerDirectory(containerfd.get(), &stepError)) {
                    fail(codeOf(stepError), stepError);
                } else if (STWContainerClassIsSystem(c)) {
                    // System containers get their ACLs here once ACL handling is part of the
                    // daemon; until then they keep the modes set above.
                    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "No system-container ACL for %@: not part of this build",
                                  staging);
                }
                if (failureCode == STWErrorSuccess &&
                    !_createSubDirectories(containerfd.get(), staging, *metadata, &stepError))
                    fail(codeOf(stepError), stepError);
            }
        }

        std::filesystem::path final;
        if (failureCode == STWErrorSuccess) {
            STW_CRASH_POINT(STWCrashPoint::createAfterStaging);
            std::optional<std::filesystem::path> classDirectory =
                configuration->containerDirectoryURLForUserIdentity(userIdentity, c, transient);
            std::optional<std::string> wellKnown = whitelist->wellknownContainerForId(id, c);
            std::string finalName = wellKnown ? *wellKnown : name;
            final = (classDirectory ? *classDirectory : std::filesystem::path()) / finalName;
            STWFileDescriptor classfd;
            if (classDirectory)
                classfd = fileManager->openDirectoryAtURL(*classDirectory, &stepError);
            if (!classfd || !fileManager->moveDirectoryAt(stagingfd.get(), name, classfd.get(), finalName,
                                                          containerfd.get(), STWFileManagerMoveDurable, staging, final,
                                                          &stepError)) {
                fail(STWErrorMoveStagingFailed, STW_ERROR(STWErrorMoveStagingFailed, stepError,
                                                          "Failed to move staging dir: %@ to live dir: %@", staging,
                                                          final));
            } else {
                STW_CRASH_POINT(STWCrashPoint::createAfterRename);
            }
        }
        if (failureCode != STWErrorSuccess) {
            STWErrorRef cleanupError;
            if (!_moveItemAtURLToDeathRow(staging, true, true, &cleanupError)) {
                STW_ERROR(STWErrorRemoveStagingFailed, cleanupError, "Failed to remove staging dir: %@", staging);
                failureCode = STWErrorRemoveStagingFailed;
            }
            *code = failureCode;
            return nullptr;
        }

        if (STWPlatformConfiguration::sharedInstance()->isFeatureEnabled("fast_container_sizing"))
            STWFileManager::defaultManager()->fastDiskUsageForURL(final);
        metadata->setUrl(final);
        metadata->setExisted(false);
        metadata->setTransient(transient);
        STW_CRASH_POINT(STWCrashPoint::createBeforeCacheAdd);
        STWErrorRef addError;
        if (!cache->addContainerMetadata(metadata, final, transient, true, &addError)) {
            STW_ERROR(STWErrorCacheAddFailed, addError, "Failed to add to cache : %@, url: %@, transient: %d",
                      metadata, final, transient ? 1 : 0);
            *code = STWErrorCacheAddFailed;
            return nullptr;
        }
        STW_LOG_DEBUG(STWLogCategory::Lifecycle, "end CreatingContainer uuid=%@", name);
        return std::make_shared<STWMetadata>(*metadata);
    });
}

std::optional<std::vector<STWMetadataRef>>
STWClientConnection::containersWithClass(STWContainerClass containerClass, bool transient, uint64_t* error) {
    using Result = std::optional<std::vector<STWMetadataRef>>;
    return catchingExceptions<Result>(__func__, error, std::nullopt, [&]() -> Result {
        if (!STWContainerClassIsValid(containerClass)) {
            STW_ERROR(STWErrorInvalidClass, nullptr, "Can't act on an invalid container class: %ld", containerClass);
            *error = STWErrorInvalidClass;
            return std::nullopt;
        }
        STWUserIdentityRef userIdentity = _clientIdentity ? _clientIdentity->userIdentity() : nullptr;
        STWAllIdentifiersLockGuard lock(STWLockMode::Reading);
        STWErrorRef cacheError;
        auto all = STWContainerCache::sharedInstance()->allContainersForUserIdentity(userIdentity, containerClass,
                                                                                     transient, &cacheError);
        if (!all) {
            *error = codeOf(cacheError);
            return std::nullopt;
        }
        return all;
    });
}

std::shared_ptr<STWMetadata> STWClientConnection::metadataWithContainerIdentity(
    const STWConcreteContainerIdentityRef& identity, uint64_t* error) {
    return catchingExceptions<std::shared_ptr<STWMetadata>>(__func__, error, nullptr, [&]() -> std::shared_ptr<STWMetadata> {
        STWMetadataRef found;
        {
            STWIdentifierLockGuard lock(identity->uuid().string(), STWLockMode::Reading);
            found = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity);
        }
        if (!found) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with user identity: %@", identity);
            *error = STWErrorNotFound;
            return nullptr;
        }
        return std::make_shared<STWMetadata>(*found);
    });
}

bool STWClientConnection::recreateDefaultStructureWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                                        uint64_t* error) {
    return catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        STWIdentifierLockGuard lock(identity->uuid().string(), STWLockMode::Writing);
        bool success = false;
        if (auto found = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity)) {
            // The container is its app's: the subdirectories are made through the
            // descriptor of the directory that holds the record's own metadata file.
            STWErrorRef stepError;
            STWFileDescriptor containerfd = found->openContainerDirectory(&stepError);
            success = containerfd && _createSubDirectories(containerfd.get(), found->url(), *found, &stepError);
            if (!success)
                *error = containerfd ? codeOf(stepError) : uint64_t{STWErrorNotFound};
            // System containers get their ACLs reapplied here once ACL handling is part of
            // the daemon.
        } else {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", identity);
            *error = STWErrorNotFound;
        }
        return success;
    });
}

STWFileDescriptor STWClientConnection::_createTopLevelContainerDirectory(int stagingfd, const std::string& name,
                                                                     const std::filesystem::path& url,
                                                                     STWContainerClass containerClass, uid_t owner,
                                                                     STWErrorRef* error) {
    if (STWContainerClassIsBundle(containerClass))
        owner = STWPlatformConfiguration::sharedInstance()->installationUID();
    else if (STWContainerClassIsSystem(containerClass))
        owner = STWFileManagerOwnerUnchanged;
    return STWFileManager::defaultManager()->createNewDirectoryAt(stagingfd, name, 0755, owner, 0, url, error);
}

int32_t STWClientConnection::_dataProtectionClassForContainerMetadata(const STWMetadata& metadata) {
    if (!STWContainerClassIsPerUser(metadata.containerClass()))
        return 0;
    if (metadata.info()) {
        const STWValue* value = STWDictionaryFind(*metadata.info(), "com.vorlane.Setwright.ContentProtectionClass");
        if (value && value->isNumber())
            return static_cast<int32_t>(value->int64Value().value_or(static_cast<int64_t>(value->realValue().value_or(0))));
    }
    // The class intended from the identifier's entitlements comes from the code-signing
    // mapping, which is not part of this build: new containers get class 0 until then.
    return 0;
}

bool STWClientConnection::_createSubDirectories(int containerfd, const std::filesystem::path& url,
                                                const STWMetadata& metadata, STWErrorRef* error) {
    STWContainerClass c = metadata.containerClass();
    mode_t mode = STWContainerClassIsSystem(c) ? 0 : 0755;
    uid_t owner = STWContainerClassIsBundle(c)   ? STWPlatformConfiguration::sharedInstance()->installationUID()
                  : STWContainerClassIsSystem(c) ? static_cast<uid_t>(-2)
                                                 : metadata.userIdentity()->posixUIDForContainerClass(c);
    int32_t protectionClass = _dataProtectionClassForContainerMetadata(metadata);
    uint64_t listError = STWErrorSuccess;
    auto paths = STWContainerLibrary::subdirectoriesForContainerClass(c, &listError);
    if (!paths) {
        STWSetError(error, STW_ERROR(listError, nullptr, "Failed to get subdirectory names for %llu : %llu", c,
                                     listError));
        return false;
    }
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Creating subdirectories for [%llu:%@] at [%@]", c, metadata.identifier(),
                  url);
    const auto& excluded = STWGlobalConfiguration::excludedFromAppUserData();
    for (const std::string& path : *paths) {
        int32_t itemClass = protectionClass;
        if (STWContainerClassIsPerUser(c) && std::find(excluded.begin(), excluded.end(), path) != excluded.end())
            itemClass = 0;
        STWErrorRef createError;
        if (!STWFileManager::defaultManager()->createDirectoryBeneath(containerfd, path, mode, owner, itemClass,
                                                                      url / path, &createError)) {
            STWSetError(error, STW_ERROR(STWErrorCreateSubdirectoryFailed, createError,
                                         "Failed to create sub-dir for %@ at %@ (protClass: %d)", metadata.identifier(),
                                         path, itemClass));
            return false;
        }
    }
    return true;
}

// ---------------------------------------------------------------------------------------
// Death row

bool STWClientConnection::_moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                                   bool startDeletionThread, STWErrorRef* error) {
    (void)isDir;
    auto fileManager = STWFileManager::defaultManager();
    auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
    STWErrorRef stepError;
    auto unique = fileManager->createTemporaryDirectoryInDirectoryURL(deathRow, "temp.", &stepError);
    if (!unique) {
        STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError, "Failed to create unique directory at: %@",
                                     deathRow));
        return false;
    }
    std::filesystem::path destination = *unique / url.filename();
    if (!fileManager->moveItemAtURL(url, destination, &stepError)) {
        if (stepError && stepError->isPOSIX(ENOENT)) {
            // Nothing to move; the empty unique directory goes with the next pass.
            return true;
        }
        STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError, "Failed to move item at: %@ to: %@", url,
                                     destination));
        return false;
    }
    if (startDeletionThread)
        deleteContainersOnDeathRowWithCompletion(nullptr);
    return true;
}

bool STWClientConnection::_removeItemOrMoveToTempAtURL(const std::filesystem::path& url, STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef removeError;
    if (fileManager->removeItemAtURL(url, &removeError) || (removeError && removeError->isPOSIX(ENOENT)))
        return true;
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
    std::filesystem::path destination =
        STWPlatformConfiguration::sharedInstance()->resolve("/tmp") / url.filename();
    STWErrorRef moveError;
    if (!fileManager->moveItemAtURL(url, destination, &moveError)) {
        STWSetError(error, STW_ERROR(STWErrorMoveDirectoryFailed, moveError, "Failed to move dir: %@ to: %@", url,
                                     destination));
        return false;
    }
    return true;
}

void STWClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion) {
    // The queue holds a transaction for the pass until it ran, so idle exit waits for it.
    STWDaemon::deathRowQueue()->async([completion = std::move(completion)] {
        auto fileManager = STWFileManager::defaultManager();
        auto deathRow = STWGlobalConfiguration::sharedInstance()->deathrowDirectory();
        uint64_t result = STWErrorSuccess;
        STWErrorRef listError;
        auto items = fileManager->urlsForItemsInDirectoryAtURL(deathRow, &listError);
        if (!items && !(listError && listError->isPOSIX(ENOENT))) {
            STW_ERROR(STWErrorDeleteFailed, listError, "Failed to get items for deletion: %@ : %@", deathRow,
                      listError);
            result = STWErrorDeleteFailed;
        }
        for (const auto& item : items ? *items : std::vector<std::filesystem::path>{}) {
            STWErrorRef itemError;
            if (!_removeItemOrMoveToTempAtURL(item, &itemError)) {
                STW_ERROR(STWErrorDestroyFailed, itemError, "Failed to destroy item at: %@", item);
                result = STWErrorDestroyFailed;
            }
        }
        if (completion)
            completion(result);
    });
}
