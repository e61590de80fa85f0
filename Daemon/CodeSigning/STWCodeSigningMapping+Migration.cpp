// What older daemons kept elsewhere and the mapping takes in: the legacy mapping file,
// moved into the database when the mapping is created; the code-signing info cached in a
// bundle container's metadata, taken in when an identifier's entitlements are asked for
// and the database has none, and in bulk by the migration sequence; the legacy
// entitlements file and the group identifiers of data containers, taken in by that
// sequence.
//
// Information already in the database wins over every legacy copy, except over an entry
// marked invalid. The files are root's, in the daemon's library directory, but were written
// by older daemons (or restored from elsewhere): every value is checked for its type, and
// a malformed one is logged and skipped without costing the others their migration.
#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/CodeSigning/STWGroupManager.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Migration/STWMigrationStatus.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/STWLocks.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWPlatformConfiguration.h"
#include "platform/STWQueue.h"

#include <cerrno>

namespace {

constexpr auto kCategory = STWLogCategory::CodeSignMapping;

constexpr const char* kCachedCodeSigningInfoKey = "com.vorlane.Setwright.CachedCodeSigningInfo";
constexpr const char* kGroupContainerIDsKey = "com.vorlane.Setwright.GroupContainerIDs";
constexpr const char* kChildPluginBundleIDsKey = "com.vorlane.Stowly.ChildPluginBundleIDs";
constexpr const char* kRegisteredByCallerKey = "com.vorlane.Stowly.EntitlementsRegisteredByCaller";
constexpr const char* kPlaceholderKey = "com.vorlane.Stowly.PlaceholderEntitlements";

bool isNotFound(const STWErrorRef& error) { return error && error->is(STWErrorIdentifierNotInDatabase); }

// Every element a string, else nullopt.
std::optional<std::vector<std::string>> stringsOf(const STWValue& value) {
    const STWValue::Array* array = value.array();
    if (!array)
        return std::nullopt;
    std::vector<std::string> strings;
    strings.reserve(array->size());
    for (const STWValue& element : *array) {
        const std::string* string = element.string();
        if (!string)
            return std::nullopt;
        strings.push_back(*string);
    }
    return strings;
}

// A bookkeeping dictionary of the legacy entitlements file, taken out of it; an empty one
// when it is absent or (logged) not a dictionary.
STWValue::Dictionary takeBookkeeping(STWValue::Dictionary& file, const char* key) {
    auto it = file.find(key);
    if (it == file.end())
        return {};
    STWValue value = std::move(it->second);
    file.erase(it);
    if (STWValue::Dictionary* dictionary = value.mutableDictionary())
        return std::move(*dictionary);
    STW_LOG_ERROR(kCategory, "Ignoring %@ of the legacy entitlements file: not a dictionary but %@", key,
                  value.description());
    return {};
}

bool isMultiUserDevice() { return STWPlatformConfiguration::sharedInstance()->isMultiUser(); }

} // namespace

std::optional<STWValue::Dictionary> STWCodeSigningMapping::_readCodeSigningMappingFromDiskAtURL(
    const std::filesystem::path& url) {
    STWErrorRef error;
    auto mapping = STW_dictionaryWithContentsOfURL(url, 0, &error);
    if (!mapping && error && !error->isPOSIX(ENOENT))
        STW_LOG_ERROR(kCategory, "Failed to read code signing mapping file at %@ : %@", url, error);
    return mapping;
}

void STWCodeSigningMapping::_onQueue_migrateFromMappingFileToDBIfNecessary() {
    _assertOnQueue(__func__);
    std::filesystem::path url = STWGlobalConfiguration::sharedInstance()->libraryDirectory() / legacyMappingFileName;
    auto mapping = _readCodeSigningMappingFromDiskAtURL(url);
    if (!mapping || mapping->empty())
        return;
    STW_LOG_NOTICE(kCategory, "Migrating code signing info from file to DB");
    _onQueue_forgetRegistration(std::nullopt);
    uint16_t migrated = 0, failed = 0;
    for (const auto& [identifier, value] : *mapping) {
        STWErrorRef error;
        const STWValue::Dictionary* serialized = value.dictionary();
        if (!serialized) {
            error = STW_ERROR_NOLOG(STWErrorInvalidContent, nullptr, "Serialized entry is not a dictionary: %@",
                                    value.description());
        } else {
            auto entry = std::make_shared<STWCodeSigningEntry>(STWCodeSigningEntry::initWithSerializedDictionary(*serialized));
            if (_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &error)) {
                ++migrated;
                continue;
            }
        }
        STW_LOG_ERROR(kCategory, "Failed to migrate code signing entry for %@ : %@", identifier, error);
        ++failed;
    }
    STW_LOG_NOTICE(kCategory, "Successfully migrated %d entries, failed to migrate %d", migrated, failed);
    // Nothing written: the file stays and the next start tries again.
    if (migrated == 0)
        return;
    STWErrorRef removeError;
    if (!STWFileManager::defaultManager()->removeItemAtURL(url, &removeError))
        STW_LOG_ERROR(kCategory, "Failed to remove legacy code signing mapping file: %@", removeError);
}

std::optional<STWValue::Dictionary> STWCodeSigningMapping::_codeSigningInfoFromCachedInfoOfContainer(
    const STWMetadata& container) {
    const STWValue::Dictionary* cached =
        container.info() ? STWDictionaryDictionary(*container.info(), kCachedCodeSigningInfoKey) : nullptr;
    if (!cached)
        return std::nullopt;
    STWValue::Dictionary info = *cached;
    if (const STWValue* entitlements = STWDictionaryFind(info, "Entitlements"))
        info[STWEntitlementKey::entitlements] = *entitlements;
    else
        info.erase(STWEntitlementKey::entitlements);
    return info;
}

std::optional<STWValue::Dictionary>
STWCodeSigningMapping::_migrateEntitlementsFromBundleContainer(const std::string& identifier) {
    // Off the queue: the container cache may itself call into the mapping.
    uint64_t code = STWErrorSuccess;
    auto identity =
        STWContainerIdentity::containerIdentityWithIdentifier(identifier, STWContainerClassBundleApplication, &code);
    if (!identity)
        return std::nullopt;
    STWErrorRef lookupError;
    auto container = STWContainerCache::sharedInstance()->containerForContainerIdentity(identity, false, false,
                                                                                        &lookupError);
    std::optional<STWValue::Dictionary> info =
        container ? _codeSigningInfoFromCachedInfoOfContainer(*container) : std::nullopt;
    if (!info)
        return std::nullopt;
    STW_LOG_NOTICE(kCategory, "Migrating code signing info from bundle container upon request for %@", identifier);
    _queue->sync([&] {
        _onQueue_forgetRegistration(identifier);
        auto entry = std::make_shared<STWCodeSigningEntry>(*info, STWContainerClassDataApplication);
        STWErrorRef writeError;
        if (!_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &writeError))
            STW_LOG_ERROR(kCategory, "Failed to write code signing info to DB for %@ : %@", identifier, writeError);
    });
    if (const STWValue::Dictionary* entitlements = STWDictionaryDictionary(*info, STWEntitlementKey::entitlements))
        return *entitlements;
    return std::nullopt;
}

// MARK: - The migration sequence

void STWCodeSigningMapping::performAllCodeSigningMigrationAndReconciliationWithCommandQueue(
    STWCommandQueue& commandQueue) {
    // No container may come or go while entries are written from what the containers say
    // and the sweep decides which group containers nobody references. Under this lock the
    // steps touch single containers (their info values) without their identifier locks:
    // an identifier lock waits until no daemon-wide lock is held, so taking one here would
    // wait for ourselves, and the daemon-wide writer already excludes every other holder.
    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    try {
        bool multiUser = isMultiUserDevice();
        // On a multi-user device the data containers' group identifiers belong to the users'
        // own migrations, and boot-time setup runs the sweep.
        if (!multiUser)
            migrateAppGroupIdsFromDataContainersToFile();
        _queue->sync([this] { _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile(); });
        migrateCachedCodeSigningInfoFromBundleContainersToMapping();
        if (!multiUser)
            STWGroupManager::defaultManager()->reconcileGroupContainersOfType(STWGroupTypeApplication, commandQueue);
    } catch (...) {
        STWErrorForCurrentException(
            __func__, __LINE__, STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage()));
    }
}

void STWCodeSigningMapping::migrateAppGroupIdsFromDataContainersToFile() {
    auto status = STWMigrationStatus::initForSystemMigration();
    if (status->hasMigrationOccurredForType(STWMigrationType::groupId))
        return;
    STW_LOG_NOTICE(kCategory, "Performing group ID migration");
    STWUserIdentityRef user = _userIdentityCache->userIdentityForLegacyMobileUser();
    auto connection = STWClientConnection::privilegedClientConnectionWithUserIdentity(user);
    for (STWContainerClass containerClass : {STWContainerClassDataApplication, STWContainerClassDataQuilletPlugin,
                                             STWContainerClassDataVPNPlugin, STWContainerClassDataSystem}) {
        STWErrorRef listError;
        auto containers =
            STWContainerCache::sharedInstance()->allContainersForUserIdentity(user, containerClass, false, &listError);
        if (!containers) {
            STW_LOG_ERROR(kCategory, "Failed to fetch list of containers for userId: 501, class %ld : %@",
                          static_cast<long>(containerClass), listError);
            continue;
        }
        _queue->sync([&] { _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(*containers); });
        for (const STWMetadataRef& container : *containers) {
            if (!container->info() || !STWDictionaryFind(*container->info(), kGroupContainerIDsKey))
                continue;
            // The caller holds the daemon-wide write lock (see above): no identifier lock.
            uint64_t code = STWErrorSuccess;
            if (!connection->setInfoValue(std::nullopt, STWValue(kGroupContainerIDsKey), container->containerIdentity(),
                                          false, &code))
                STW_LOG_ERROR(kCategory, "Failed to clear group id metadata for %@ : %llu",
                              container->containerIdentity(), code);
        }
    }
    status->setMigrationCompleteForType(STWMigrationType::groupId);
}

void STWCodeSigningMapping::_onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
    const std::vector<STWMetadataRef>& containers) {
    _assertOnQueue(__func__);
    for (const STWMetadataRef& container : containers) {
        const STWValue* value = container->info() ? STWDictionaryFind(*container->info(), kGroupContainerIDsKey) : nullptr;
        if (!value)
            continue;
        const std::string& identifier = container->identifier();
        std::optional<std::vector<std::string>> groups = stringsOf(*value);
        if (!groups) {
            STW_LOG_ERROR(kCategory, "Ignoring group container IDs of data container for %@: not an array of strings: %@",
                          identifier, value->description());
            continue;
        }
        STW_LOG_DEBUG(kCategory, "Data container for userId: 501, identifier %@ references container IDs: %@",
                      identifier, value->description());
        STWErrorRef readError;
        auto stored = _codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &readError);
        if (stored) {
            STW_LOG_NOTICE(kCategory, "Deleting app group entitlements for %@ because we already have them in mapping",
                           identifier);
            continue;
        }
        if (!isNotFound(readError)) {
            STW_LOG_ERROR(kCategory, "Error retrieving entry from DB with identifier %@ : %@", identifier, readError);
            continue;
        }
        STW_LOG_NOTICE(kCategory, "Migrating app group entitlements for %@", identifier);
        STWValue::Dictionary entitlements{
            {STWEntitlementKey::applicationGroups, STWValue(STWValue::Array(groups->begin(), groups->end()))}};
        auto entry = std::make_shared<STWCodeSigningEntry>(
            STWValue::Dictionary{{STWEntitlementKey::entitlements, STWValue(std::move(entitlements))}},
            container->containerClass());
        // Not from an installed bundle: hidden from callers until the installer says more.
        entry->setInvalid(true);
        _onQueue_forgetRegistration(identifier);
        STWErrorRef writeError;
        if (!_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &writeError))
            STW_LOG_ERROR(kCategory, "Failed to write migrated group id info to DB for %@ : %@", identifier,
                          writeError);
    }
}

std::vector<std::pair<std::string, STWCodeSigningEntry>>
STWCodeSigningMapping::_codeSigningEntriesFromLegacyEntitlements(const STWValue::Dictionary& legacyEntitlements) {
    STWValue::Dictionary file = legacyEntitlements;
    STWValue::Dictionary children = takeBookkeeping(file, kChildPluginBundleIDsKey);
    STWValue::Dictionary registered = takeBookkeeping(file, kRegisteredByCallerKey);
    STWValue::Dictionary placeholders = takeBookkeeping(file, kPlaceholderKey);
    std::vector<std::pair<std::string, STWCodeSigningEntry>> entries;
    for (auto& [identifier, value] : file) {
        if (!value.isDictionary()) {
            STW_LOG_ERROR(kCategory, "Ignoring legacy entitlements for %@: not a dictionary but %@", identifier,
                          value.description());
            continue;
        }
        STWCodeSigningEntry entry(STWValue::Dictionary{{STWEntitlementKey::entitlements, std::move(value)}});
        if (const STWValue* list = STWDictionaryFind(children, identifier)) {
            if (auto strings = stringsOf(*list))
                entry.setChildBundleIdentifiers(std::move(strings));
            else
                STW_LOG_ERROR(kCategory, "Ignoring legacy child bundle IDs of %@: not an array of strings: %@",
                              identifier, list->description());
        }
        entry.setPlaceholder(STWDictionaryFind(placeholders, identifier) != nullptr);
        bool byCaller = STWDictionaryBool(registered, identifier);
        entry.setRegisteredByCaller(byCaller);
        // What the installer told older daemons comes back through the installer: until
        // then the entry only keeps the groups it named.
        entry.setInvalid(!byCaller);
        entries.emplace_back(identifier, std::move(entry));
    }
    return entries;
}

void STWCodeSigningMapping::_onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
    _assertOnQueue(__func__);
    std::filesystem::path url = STWGlobalConfiguration::sharedInstance()->libraryDirectory() / legacyEntitlementsFileName;
    auto fileManager = STWFileManager::defaultManager();
    if (fileManager->itemDoesNotExistAtURL(url))
        return;
    STW_LOG_NOTICE(kCategory, "Performing legacy entitlement migration");
    STWErrorRef readError;
    auto file = STW_dictionaryWithContentsOfURL(url, 0, &readError);
    if (!file) {
        // Nothing taken in: the file stays for someone to look at, and the next run tries again.
        STW_LOG_ERROR(kCategory, "Entitlement File exists at %@, but we unexpectedly cant read it", url);
        return;
    }
    _onQueue_forgetRegistration(std::nullopt);
    for (auto& [identifier, entry] : _codeSigningEntriesFromLegacyEntitlements(*file)) {
        STWErrorRef lookupError;
        auto stored = _codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &lookupError);
        if (stored && !stored->invalid()) {
            STW_LOG_NOTICE(kCategory, "Already have code signing info for %@.  No need to migrate legacy entitlements.",
                           identifier);
            continue;
        }
        if (!stored && !isNotFound(lookupError)) {
            STW_LOG_ERROR(kCategory, "Error retrieving entry from DB with identifier %@ : %@", identifier, lookupError);
            continue;
        }
        STW_LOG_NOTICE(kCategory, "Migrating legacy entitlements for %@", identifier);
        STWErrorRef writeError;
        if (!_codeSigningMappingDB->addCodeSigningEntry(std::make_shared<STWCodeSigningEntry>(std::move(entry)),
                                                        identifier, &writeError))
            STW_LOG_ERROR(kCategory, "Failed to write migrated legacy info to DB for %@ : %@", identifier, writeError);
    }
    STWErrorRef removeError;
    if (!fileManager->removeItemAtURL(url, &removeError))
        STW_LOG_ERROR(kCategory, "Failed to remove legacy file at %@: %@", url, removeError);
    STW_LOG_NOTICE(kCategory, "Legacy entitlement migration completed");
}

void STWCodeSigningMapping::migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
    auto status = STWMigrationStatus::initForSystemMigration();
    if (status->hasMigrationOccurredForType(STWMigrationType::codeSigning))
        return;
    STW_LOG_NOTICE(kCategory, "Performing code signing migration");
    STWUserIdentityRef user = STWUserIdentityCache::defaultUserIdentity();
    auto connection = STWClientConnection::privilegedClientConnectionWithUserIdentity(user);
    for (STWContainerClass containerClass : {STWContainerClassBundleApplication, STWContainerClassBundleQuilletPlugin,
                                             STWContainerClassBundleVPNPlugin, STWContainerClassBundleFramework}) {
        STWErrorRef listError;
        auto containers =
            STWContainerCache::sharedInstance()->allContainersForUserIdentity(user, containerClass, false, &listError);
        if (!containers) {
            STW_LOG_ERROR(kCategory, "Failed to fetch list of containers for class %llu : %@",
                          static_cast<unsigned long long>(containerClass), listError);
            continue;
        }
        _queue->sync([&] {
            _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(*containers,
                                                                                           containerClass);
        });
        for (const STWMetadataRef& container : *containers) {
            if (!container->info() || !STWDictionaryFind(*container->info(), kCachedCodeSigningInfoKey))
                continue;
            // The caller holds the daemon-wide write lock: no identifier lock.
            uint64_t code = STWErrorSuccess;
            if (!connection->setInfoValue(std::nullopt, STWValue(kCachedCodeSigningInfoKey),
                                          container->containerIdentity(), false, &code))
                STW_LOG_ERROR(kCategory, "Error setting info value for identity %@ : %llu",
                              container->containerIdentity(), code);
        }
    }
    status->setMigrationCompleteForType(STWMigrationType::codeSigning);
}

void STWCodeSigningMapping::_onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
    const std::vector<STWMetadataRef>& containers, STWContainerClass containerClass) {
    _assertOnQueue(__func__);
    for (const STWMetadataRef& container : containers) {
        std::optional<STWValue::Dictionary> info = _codeSigningInfoFromCachedInfoOfContainer(*container);
        if (!info) {
            if (container->info() && STWDictionaryFind(*container->info(), kCachedCodeSigningInfoKey))
                STW_LOG_ERROR(kCategory, "Ignoring cached code signing info of bundle container for %@: not a dictionary",
                              container->identifier());
            continue;
        }
        const std::string& identifier = container->identifier();
        STWErrorRef readError;
        auto stored = _codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &readError);
        if (stored && !stored->invalid()) {
            STW_LOG_NOTICE(kCategory, "Deleting cached code signing info for %@ because we already have it in mapping",
                           identifier);
            continue;
        }
        if (!stored && !isNotFound(readError)) {
            STW_LOG_ERROR(kCategory, "Error retrieving entry from DB with identifier %@ : %@", identifier, readError);
            continue;
        }
        STW_LOG_NOTICE(kCategory, "Migrating code signing info for %@", identifier);
        _onQueue_forgetRegistration(identifier);
        auto entry = std::make_shared<STWCodeSigningEntry>(std::move(*info),
                                                           STWContainerClassDataClassForBundleClass(containerClass));
        STWErrorRef writeError;
        if (!_codeSigningMappingDB->addCodeSigningEntry(entry, identifier, &writeError))
            STW_LOG_ERROR(kCategory, "Failed to write migrated cached cs info from bundle container to DB for %@ : %@",
                          identifier, writeError);
    }
}
