// Create-or-lookup: finding a container in the cache and building a new one in staging,
// published by one rename (the operations of STWClientConnection that make containers).
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/DataProtection/STWDataProtectionManager.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/STWLocks.h"
#include "common/STWLog.h"
#include "platform/STWContainerLibrary.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWUserDatabase.h"

#include <algorithm>

std::shared_ptr<STWMetadata> STWClientConnection::createOrLookupContainerWithContainerIdentity(
    const STWContainerIdentityRef& identity, bool createIfNecessary, bool transient, bool useLocking, uint64_t* error) {
    uint64_t ignored = STWErrorSuccess;
    uint64_t* code = error ? error : &ignored;
    return _catchingExceptions<std::shared_ptr<STWMetadata>>(__func__, code, nullptr, [&]() -> std::shared_ptr<STWMetadata> {
        bool existed = false;
        STWMetadataRef record =
            _createOrLookupContainerWithContainerIdentity(identity, createIfNecessary, transient, useLocking, &existed, code);
        if (!record)
            return nullptr;
        // A record of the caller's own: the cache's stays as it is.
        auto result = std::make_shared<STWMetadata>(*record);
        result->setExisted(existed);
        return result;
    });
}

STWMetadataRef STWClientConnection::createOrLookupContainerRecordWithContainerIdentity(
    const STWContainerIdentityRef& identity, bool createIfNecessary, bool transient, bool useLocking, bool* existed,
    uint64_t* error) {
    uint64_t ignored = STWErrorSuccess;
    uint64_t* code = error ? error : &ignored;
    // Reported under the name of the operation it is a form of.
    return _catchingExceptions<STWMetadataRef>("createOrLookupContainerWithContainerIdentity", code, nullptr, [&] {
        return _createOrLookupContainerWithContainerIdentity(identity, createIfNecessary, transient, useLocking, existed,
                                                             code);
    });
}

STWMetadataRef STWClientConnection::_createOrLookupContainerWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                                bool createIfNecessary, bool transient,
                                                                                bool useLocking, bool* existed,
                                                                                uint64_t* code) {
    *existed = false;
    const std::string* client = _clientIdentity ? &_clientIdentity->bundleIdentifier() : nullptr;
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
    static const std::string noClient;
    bool whitelisted = whitelist->isLookupWhitelistedFromCodeSignIdentifier(client ? *client : noClient, c, id);
    bool isGroup = STWContainerClassIsGroup(c);
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
        // An app whose entitlements ask for a system container may have its own.
        auto ownsSystemContainer = [&] {
            auto mapping = STWCodeSigningMapping::sharedInstance();
            return client && *client == id && mapping && mapping->identifierHasSystemContainer(id);
        };
        if (!whitelisted && !ownsSystemContainer()) {
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
            *existed = true;
            return found;
        }
        if (!lookupError || !lookupError->is(STWErrorNotFound)) {
            *code = _codeOfError(lookupError);
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
            *existed = true;
            return found;
        }
        STWErrorRef moveError;
        if (!_moveItemAtURLToDeathRow(found->url(), true, true, &moveError)) {
            STW_ERROR(STWErrorRemoveTransientFailed, moveError, "Failed to remove transient container at %@",
                      found->url());
            *code = STWErrorRemoveTransientFailed;
            return nullptr;
        }
    } else if (!lookupError || !lookupError->is(STWErrorNotFound)) {
        *code = _codeOfError(lookupError);
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
    // Below the user's home everything is the user's: no link is followed there.
    std::filesystem::path trustedAncestor = STWTrustedAncestorForClass(userIdentity, c);
    STWFileDescriptor stagingfd = fileManager->openDirectoryAtURL(stagingDirectory, trustedAncestor, &stepError);
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
                fail(_codeOfError(stepError), stepError);
            } else if (STWContainerClassIsSystem(c) &&
                       !fileManager->setTopLevelSystemContainerACLAt(containerfd.get(), staging, &stepError)) {
                fail(_codeOfError(stepError), stepError);
            }
            if (failureCode == STWErrorSuccess &&
                !_createSubDirectories(containerfd.get(), staging, *metadata, &stepError))
                fail(_codeOfError(stepError), stepError);
            // The subdirectories were made with mode 0, and on Linux the mode's group bits
            // are the mask of the ACL they inherited: give them their entry in full.
            if (failureCode == STWErrorSuccess && STWContainerClassIsSystem(c) &&
                !fileManager->standardizeACLsAt(containerfd.get(), staging, true, &stepError))
                fail(_codeOfError(stepError), stepError);
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
            classfd = fileManager->openDirectoryAtURL(*classDirectory, trustedAncestor, &stepError);
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
        // Published but unknown to the cache: it must not stay behind, or every retry
        // would leave one more.
        STWErrorRef cleanupError;
        if (!_moveItemAtURLToDeathRow(final, true, true, &cleanupError))
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to send %@ to death row after the cache refused it: %@",
                          final, cleanupError);
        *code = STWErrorCacheAddFailed;
        return nullptr;
    }
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "end CreatingContainer uuid=%@", name);
    return metadata;
}

std::optional<std::vector<STWMetadataRef>>
STWClientConnection::containersWithClass(STWContainerClass containerClass, bool transient, uint64_t* error) {
    using Result = std::optional<std::vector<STWMetadataRef>>;
    return _catchingExceptions<Result>(__func__, error, std::nullopt, [&]() -> Result {
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
            *error = _codeOfError(cacheError);
            return std::nullopt;
        }
        return all;
    });
}

std::shared_ptr<STWMetadata> STWClientConnection::metadataWithContainerIdentity(
    const STWConcreteContainerIdentityRef& identity, uint64_t* error) {
    return _catchingExceptions<std::shared_ptr<STWMetadata>>(__func__, error, nullptr, [&]() -> std::shared_ptr<STWMetadata> {
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
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        STWIdentifierLockGuard lock(identity->uuid().string(), STWLockMode::Writing);
        bool success = false;
        if (auto found = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity)) {
            // The container is its app's: the subdirectories are made through the
            // descriptor of the directory that holds the record's own metadata file.
            STWErrorRef stepError;
            STWFileDescriptor containerfd = found->openContainerDirectory(&stepError);
            success = containerfd && _createSubDirectories(containerfd.get(), found->url(), *found, &stepError) &&
                      (!STWContainerClassIsSystem(found->containerClass()) ||
                       STWFileManager::defaultManager()->standardizeACLsAt(containerfd.get(), found->url(), true,
                                                                          &stepError));
            if (!success)
                *error = containerfd ? _codeOfError(stepError) : uint64_t{STWErrorNotFound};
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
            return static_cast<int32_t>(value->truncatedInt64Value().value_or(0));
    }
    return STWDataProtectionManager::defaultManager()->intendedDataProtectionClassBasedOnEntitlementsForIdentifier(
        metadata.identifier());
}

bool STWClientConnection::_createSubDirectories(int containerfd, const std::filesystem::path& url,
                                                const STWMetadata& metadata, STWErrorRef* error) {
    STWContainerClass c = metadata.containerClass();
    mode_t mode = STWContainerClassIsSystem(c) ? 0 : 0755;
    uid_t owner = STWContainerClassIsBundle(c)   ? STWPlatformConfiguration::sharedInstance()->installationUID()
                  : STWContainerClassIsSystem(c) ? STWUserDatabase::nobodyUID()
                                                 : metadata.userIdentity()->posixUIDForContainerClass(c);
    int32_t protectionClass = _dataProtectionClassForContainerMetadata(metadata);
    STWErrorRef listError;
    auto paths = STWContainerLibrary::subdirectoriesForContainerClass(c, &listError);
    if (!paths) {
        // The library's one failure is a class it has no list for.
        uint64_t code = STWErrorUnexpectedClass;
        STWSetError(error,
                    STW_ERROR(code, listError, "Failed to get subdirectory names for %llu : %llu", c, code));
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
