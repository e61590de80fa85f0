#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/STWLocks.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWQueue.h"

#include <algorithm>

namespace {

constexpr auto kCategory = STWLogCategory::CodeSignMapping;

bool isNotFound(const STWErrorRef& error) { return error && error->is(STWErrorIdentifierNotInDatabase); }

const STWValue::Dictionary* entitlementsOf(const STWCodeSigningEntry& entry) {
    return entry.codeSigningInfo() ? STWDictionaryDictionary(*entry.codeSigningInfo(), STWEntitlementKey::entitlements)
                                   : nullptr;
}

bool hasSystemContainer(const STWValue::Dictionary* entitlements) {
    return entitlements && STWDictionaryBool(*entitlements, STWEntitlementKey::systemContainer);
}

std::string describeList(const std::optional<STWGroupIdentifierList>& list) {
    return list ? STWValue(STWValue::Array(list->begin(), list->end())).description() : std::string("(null)");
}

} // namespace

const std::shared_ptr<STWQueue>& STWCodeSigningMapping::sharedQueue() {
    static const std::shared_ptr<STWQueue> queue = STWQueue::create("com.vorlane.Stowly.EntitlementQueue");
    return queue;
}

std::shared_ptr<STWCodeSigningMapping> STWCodeSigningMapping::sharedInstance() {
    // Not a once-guard: a database that could not be opened is tried again next time.
    static STWMutex lock;
    static std::shared_ptr<STWCodeSigningMapping> instance STW_GUARDED_BY(lock);
    STWLockGuard guard(lock);
    if (!instance) {
        auto db = STWSQLiteDB::initWithParentDirectoryURL(STWGlobalConfiguration::sharedInstance()->libraryDirectory());
        if (!db) {
            STW_LOG_ERROR(kCategory, "Failed to initialize database.");
            return nullptr;
        }
        instance = std::make_shared<STWCodeSigningMapping>(STWUserIdentitySharedCache::sharedInstance(), sharedQueue(),
                                                           std::move(db));
    }
    return instance;
}

STWCodeSigningMapping::STWCodeSigningMapping(std::shared_ptr<STWUserIdentityCache> userIdentityCache,
                                             std::shared_ptr<STWQueue> queue, std::unique_ptr<STWSQLiteDB> mappingDB)
    : _userIdentityCache(std::move(userIdentityCache)), _queue(std::move(queue)),
      _codeSigningMappingDB(std::move(mappingDB)) {
    _queue->sync([this] { _onQueue_migrateFromMappingFileToDBIfNecessary(); });
}

void STWCodeSigningMapping::_assertOnQueue(const char* function) const { _queue->assertCurrent(function); }

std::shared_ptr<STWCodeSigningEntry> STWCodeSigningMapping::_onQueue_entryForIdentifier(const std::string& identifier,
                                                                                        STWErrorRef* error) {
    _assertOnQueue(__func__);
    STWErrorRef readError;
    auto entry = _codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &readError);
    if (!entry && readError && !isNotFound(readError))
        STW_LOG_ERROR(kCategory, "Error retrieving entry from DB with identifier %@ : %@", identifier, readError);
    STWSetError(error, std::move(readError));
    return entry;
}

// MARK: - Updates

uint64_t STWCodeSigningMapping::processCodeSigningInfo(const std::optional<STWValue::Dictionary>& info,
                                                       const std::optional<std::string>& identifier,
                                                       const std::optional<STWValue::Dictionary>& options,
                                                       STWCommandQueue& commandQueue) {
    if (!identifier || identifier->empty())
        return STWErrorNoIdentifier;
    std::optional<STWValue::Dictionary> oldEntitlements = entitlementsForIdentifier(*identifier);
    return _queue->syncResult([&] {
        return _onQueue_processCodeSigningInfo(info, *identifier, options, oldEntitlements, commandQueue);
    });
}

uint64_t STWCodeSigningMapping::_onQueue_processCodeSigningInfo(
    const std::optional<STWValue::Dictionary>& info, const std::string& identifier,
    const std::optional<STWValue::Dictionary>& options, const std::optional<STWValue::Dictionary>& oldEntitlements,
    STWCommandQueue& commandQueue) {
    _assertOnQueue(__func__);
    if (identifier.empty())
        return STWErrorNoIdentifier;
    static const STWValue::Dictionary noOptions;
    const STWValue::Dictionary& option = options ? *options : noOptions;
    std::vector<STWCodeSigningEntry> entries;
    std::vector<std::string> identifiers;
    try {
        STWErrorRef readError;
        auto stored = _onQueue_entryForIdentifier(identifier, &readError);
        if (!stored && readError && !isNotFound(readError))
            return STWDaemonCodeOfError(readError, STWErrorDatabase);

        STWCodeSigningEntry entry;
        entry.setDataContainerClass(STWDictionaryUInt64(option, "com.vorlane.Stowly.DataContainerClass").value_or(0));
        if (const std::string* parent = STWDictionaryString(option, "com.vorlane.Stowly.ParentBundleID")) {
            STWErrorRef parentError;
            auto parentEntry = _onQueue_entryForIdentifier(*parent, &parentError);
            if (!parentEntry && parentError && !isNotFound(parentError))
                return STWDaemonCodeOfError(parentError, STWErrorDatabase);
            // A parent not stored yet gets an entry without info, which is written only if
            // the parent exists by the time the lists are written.
            STWCodeSigningEntry parentValue = parentEntry ? *parentEntry : STWCodeSigningEntry();
            std::vector<std::string> children = parentValue.childBundleIdentifiers().value_or(std::vector<std::string>());
            if (std::find(children.begin(), children.end(), identifier) == children.end()) {
                children.push_back(identifier);
                parentValue.setChildBundleIdentifiers(children);
                STW_LOG_DEBUG(kCategory, "Staging Child Bundles: %@ for parent ID: %@ by appending: %@",
                              describeList(children), *parent, identifier);
                entries.push_back(std::move(parentValue));
                identifiers.push_back(*parent);
            }
        }
        // An option only ever sets a flag.
        if (STWDictionaryBool(option, "RegByCaller"))
            entry.setRegisteredByCaller(true);
        if (STWDictionaryBool(option, "com.vorlane.Stowly.PlaceholderEntitlements"))
            entry.setPlaceholder(true);
        if (STWDictionaryBool(option, "com.vorlane.Stowly.AdvanceCopy"))
            entry.setAdvanceCopy(true);
        entry.setCodeSigningInfo(info);

        if (!stored || !(*stored == entry)) {
            const STWValue::Dictionary* newEntitlements = entitlementsOf(entry);
            const STWValue::Dictionary* old = oldEntitlements ? &*oldEntitlements : nullptr;
            if (hasSystemContainer(old) && !hasSystemContainer(newEntitlements)) {
                uint64_t code = STWErrorSuccess;
                auto system = STWContainerIdentity::containerIdentityWithIdentifier(identifier, STWContainerClassDataSystem,
                                                                                   &code);
                if (!system) {
                    STW_LOG_ERROR(kCategory, "Failed to create system container identity for %@: %@", identifier, code);
                } else {
                    STW_LOG_NOTICE(kCategory, "Deleting system container for ID: %@ because it is no longer in the entitlements",
                                   identifier);
                    commandQueue.insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
                        {system}, true, [identifier](uint64_t failure) {
                            STW_LOG_ERROR(kCategory, "Failed to destroy system container with identifier %@: %llu",
                                          identifier, failure);
                        }));
                }
            }
            auto newAppGroups = newEntitlements ? _copyApplicationGroupEntitlementForIdentifier(
                                                      identifier, *newEntitlements, STWEntitlementKey::applicationGroups)
                                                : std::nullopt;
            auto oldAppGroups = _appGroupIdentifiersForIdentifier(identifier, oldEntitlements);
            if (newAppGroups || oldAppGroups)
                _onQueue_handleChangeFromOldGroupContainerIds(oldAppGroups, newAppGroups, STWGroupTypeApplication,
                                                              commandQueue);
            auto newSystemGroups =
                newEntitlements ? _unfilteredSystemGroupIdentifiers(identifier, *newEntitlements) : std::nullopt;
            auto oldSystemGroups = _systemGroupIdentifiersForIdentifier(identifier, oldEntitlements);
            if (newSystemGroups || oldSystemGroups)
                _onQueue_handleChangeFromOldGroupContainerIds(oldSystemGroups, newSystemGroups, STWGroupTypeSystem,
                                                              commandQueue);
            STW_LOG_INFO(kCategory,
                         "Reconciled; old app groups: %@, new app groups: %@, old system groups: %@, new system groups: %@",
                         describeList(oldAppGroups), describeList(newAppGroups), describeList(oldSystemGroups),
                         describeList(newSystemGroups));
            if (!info)
                entry = STWCodeSigningEntry();
            entries.push_back(std::move(entry));
            identifiers.push_back(identifier);
        }
        if (!entries.empty())
            if (STWErrorRef writeError = _onQueue_setCodeSigningDictionaryValues(entries, identifiers))
                return STWDaemonCodeOfError(writeError, STWErrorDatabase);
        return STWErrorSuccess;
    } catch (...) {
        return STWDaemonCodeOfError(
            STWErrorForCurrentException(__func__, __LINE__,
                                        STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage())),
            STWErrorDatabase);
    }
}

STWErrorRef STWCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(const std::vector<STWCodeSigningEntry>& entries,
                                                                           const std::vector<std::string>& identifiers) {
    _assertOnQueue(__func__);
    if (entries.size() != identifiers.size())
        return STW_ERROR(STWErrorCountMismatch, nullptr,
                         "Can't act on an invalid input: values count: %ld, IDs count: %ld", entries.size(),
                         identifiers.size());
    STWErrorRef result;
    for (size_t i = 0; i < entries.size(); ++i) {
        const std::string& identifier = identifiers[i];
        STWErrorRef readError;
        auto stored = _onQueue_entryForIdentifier(identifier, &readError);
        if (!stored && readError && !isNotFound(readError)) {
            result = readError;
            break;
        }
        bool storedAbsent = !stored || !stored->codeSigningInfo();
        bool newAbsent = !entries[i].codeSigningInfo();
        if ((storedAbsent && newAbsent) || (stored && *stored == entries[i]))
            continue;
        _onQueue_forgetRegistration(identifier);
        STWErrorRef writeError;
        if (newAbsent) {
            if (_codeSigningMappingDB->deleteCodeSigningEntryWithIdentifier(identifier, &writeError)) {
                STW_LOG_NOTICE(kCategory, "Deleted Code Signing Mapping for ID: %@", identifier);
            } else {
                STW_LOG_ERROR(kCategory, "Failed to delete code signing info from DB for %@ : %@", identifier,
                              writeError);
                result = writeError;
            }
        } else if (_codeSigningMappingDB->addCodeSigningEntry(std::make_shared<STWCodeSigningEntry>(entries[i]),
                                                              identifier, &writeError)) {
            STW_LOG_INFO(kCategory, "Set Code Signing Mapping for ID: %@ : %@", identifier, entries[i].description());
        } else {
            STW_LOG_ERROR(kCategory, "Failed to write code signing info to DB for %@ : %@", identifier, writeError);
            result = writeError;
        }
    }
    return result;
}

uint64_t STWCodeSigningMapping::processCallerRegisteredEntitlements(const STWValue::Dictionary& entitlements,
                                                                    const std::optional<std::string>& identifier,
                                                                    STWCommandQueue& commandQueue) {
    if (!identifier || identifier->empty())
        return STWErrorNoIdentifier;
    // Every request of a caller with an identity comes through here: an unchanged
    // registration is answered from memory.
    if (auto known = _rememberedRegistration(*identifier))
        if (known->installerProvided || known->entitlements == entitlements)
            return STWErrorSuccess;
    std::optional<uint64_t> answer = _queue->syncResult([&]() -> std::optional<uint64_t> {
        STWErrorRef readError;
        auto stored = _onQueue_entryForIdentifier(*identifier, &readError);
        if (!stored && readError && !isNotFound(readError))
            return STWDaemonCodeOfError(readError, STWErrorDatabase);
        if (stored && stored->codeSigningInfo() && !stored->registeredByCaller()) {
            // What the installer provided always wins.
            _onQueue_rememberRegistration(*identifier, {true, {}});
            return STWErrorSuccess;
        }
        if (stored && stored->registeredByCaller()) {
            const STWValue::Dictionary* current = entitlementsOf(*stored);
            if (current && *current == entitlements) {
                _onQueue_rememberRegistration(*identifier, {false, entitlements});
                return STWErrorSuccess;
            }
            STW_LOG_NOTICE(kCategory, "%@ has changed entitlements. Re-registering.", *identifier);
        }
        return std::nullopt;
    });
    if (answer)
        return *answer;
    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    STWValue::Dictionary info{{STWEntitlementKey::entitlements, STWValue(entitlements)}};
    STWValue::Dictionary options{{"RegByCaller", STWValue(true)}};
    return processCodeSigningInfo(info, identifier, options, commandQueue);
}

void STWCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                                     STWCommandQueue& commandQueue) {
    std::vector<std::string> identifiers = childBundleIdentifiersForParentIdentifier(identifier).value_or(
        std::vector<std::string>());
    identifiers.push_back(identifier);
    for (const std::string& each : identifiers) {
        uint64_t code = processCodeSigningInfo(std::nullopt, each, std::nullopt, commandQueue);
        if (code != STWErrorSuccess)
            STW_LOG_ERROR(kCategory, "Failed to clear entitlements for %@ : %llu", each, code);
    }
}

bool STWCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                                 STWErrorRef* error) {
    return _queue->syncResult([&] {
        _onQueue_forgetRegistration(std::nullopt);
        return _codeSigningMappingDB->invalidateCodeSigningForIdentifierAndAllChildren(identifier, error);
    });
}

bool STWCodeSigningMapping::invalidateCodeSigningInfoForIdentifier(const std::string& identifier, STWErrorRef* error) {
    return _queue->syncResult([&] {
        _onQueue_forgetRegistration(identifier);
        return _codeSigningMappingDB->invalidateCodeSigningWithIdentifier(identifier, error);
    });
}

bool STWCodeSigningMapping::removeAllAdvanceCopiesWithError(STWErrorRef* error) {
    return _queue->syncResult([&] {
        _onQueue_forgetRegistration(std::nullopt);
        return _codeSigningMappingDB->deleteAllAdvanceCopiesOfCodeSigningEntriesWithError(error);
    });
}

uint64_t STWCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    STWErrorRef listError;
    auto identifiers = identifiersWithError(&listError);
    if (!identifiers) {
        if (!listError)
            return STWErrorSuccess; // nothing stored
        STW_LOG_ERROR(kCategory, "Failed to enumerate containers when invalidating code signing info: %@", listError);
        return STWDaemonCodeOfError(listError, STWErrorDatabase);
    }
    auto cache = STWContainerCache::sharedInstance();
    for (const std::string& identifier : *identifiers) {
        STWErrorRef readError;
        auto entry = _queue->syncResult([&] { return _codeSigningMappingDB->codeSigningEntryWithIdentifier(identifier, &readError); });
        if (!entry) {
            STW_LOG_ERROR(kCategory, "Error fetching code sign info for %@ to check for invalidation: %@", identifier,
                          readError);
            continue;
        }
        STWContainerClass dataClass = entry->dataContainerClass();
        bool isPlugIn = dataClass >= STWContainerClassBundleQuilletPlugin && dataClass <= STWContainerClassDataVPNPlugin;
        bool hasParent = isPlugIn && parentIdentifierForChildIdentifier(identifier).has_value();
        STW_LOG_INFO(kCategory,
                     "Checking for invalidation: identifier = %@, codeSigningEntry = <%p>, isRegisteredByCaller = %d, "
                     "isPlugIn = %d, hasParent = %d",
                     identifier, static_cast<const void*>(entry.get()), entry->registeredByCaller() ? 1 : 0,
                     isPlugIn ? 1 : 0, hasParent ? 1 : 0);
        if (entry->registeredByCaller() || hasParent)
            continue;
        bool found = false;
        for (STWContainerClass bundleClass :
             {STWContainerClassBundleApplication, STWContainerClassBundleQuilletPlugin, STWContainerClassBundleVPNPlugin}) {
            uint64_t code = STWErrorSuccess;
            auto identity = STWContainerIdentity::containerIdentityWithIdentifier(identifier, bundleClass, &code);
            STWErrorRef lookupError;
            if (identity && cache->containerForContainerIdentity(identity, false, false, &lookupError)) {
                found = true;
                break;
            }
        }
        if (found)
            continue;
        STW_LOG_NOTICE(kCategory, "Invalidating: identifier = %@, isPlugin = %d", identifier, isPlugIn ? 1 : 0);
        STWErrorRef invalidateError;
        if (!invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, &invalidateError))
            STW_ERROR(STWErrorDatabase, invalidateError, "Failed to invalidate code signing info for %@ : %@",
                      identifier, invalidateError);
    }
    return STWErrorSuccess;
}

// MARK: - Queries

std::shared_ptr<const STWCodeSigningEntry> STWCodeSigningMapping::codeSigningEntryForIdentifier(
    const std::string& identifier, STWErrorRef* error) {
    return _queue->syncResult([&] { return std::shared_ptr<const STWCodeSigningEntry>(_onQueue_entryForIdentifier(identifier, error)); });
}

std::optional<STWValue::Dictionary> STWCodeSigningMapping::getCodeSigningInfoForIdentifier(const std::string& identifier) {
    auto entry = codeSigningEntryForIdentifier(identifier, nullptr);
    if (!entry || entry->placeholder() || entry->advanceCopy() || entry->invalid())
        return std::nullopt;
    return entry->codeSigningInfo();
}

std::optional<STWValue::Dictionary> STWCodeSigningMapping::entitlementsForIdentifier(const std::string& identifier) {
    if (identifier.empty())
        return std::nullopt;
    auto entry = codeSigningEntryForIdentifier(identifier, nullptr);
    if (const STWValue::Dictionary* entitlements = entry ? entitlementsOf(*entry) : nullptr)
        return *entitlements;
    return _migrateEntitlementsFromBundleContainer(identifier);
}

bool STWCodeSigningMapping::identifierHasCallerRegisteredEntitlements(const std::string& identifier) {
    auto entry = codeSigningEntryForIdentifier(identifier, nullptr);
    return entry && entry->registeredByCaller();
}

uint64_t STWCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
    {
        STWLockGuard guard(_registrationsLock);
        if (auto it = _dataContainerClasses.find(identifier); it != _dataContainerClasses.end())
            return it->second;
    }
    // Read and remembered in one go on the queue, so that no write can come between.
    return _queue->syncResult([&] {
        STWErrorRef error;
        auto entry = _onQueue_entryForIdentifier(identifier, &error);
        uint64_t dataContainerClass = entry ? entry->dataContainerClass() : 0;
        if (entry || isNotFound(error)) {
            STWLockGuard guard(_registrationsLock);
            if (_dataContainerClasses.size() >= _maxRegistrations)
                _dataContainerClasses.clear();
            _dataContainerClasses[identifier] = dataContainerClass;
        }
        return dataContainerClass;
    });
}

bool STWCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
    auto entitlements = entitlementsForIdentifier(identifier);
    return hasSystemContainer(entitlements ? &*entitlements : nullptr);
}

std::optional<STWGroupIdentifierList> STWCodeSigningMapping::appGroupIdentifiersForIdentifier(const std::string& identifier) {
    return _appGroupIdentifiersForIdentifier(identifier, entitlementsForIdentifier(identifier));
}

std::optional<STWGroupIdentifierList> STWCodeSigningMapping::systemGroupIdentifiersForIdentifier(const std::string& identifier) {
    return _systemGroupIdentifiersForIdentifier(identifier, entitlementsForIdentifier(identifier));
}

template <class Query>
auto STWCodeSigningMapping::_familyQuery(const std::string& identifier, const Query& query) {
    return _queue->syncResult([&] {
        STWErrorRef error;
        auto answer = query(*_codeSigningMappingDB, &error);
        // "Not found" is an answer: no children, or no parent.
        if (!answer && error && !isNotFound(error))
            STW_LOG_ERROR(kCategory, "Error retrieving child bundles ids from DB with identifier %@ : %@", identifier,
                          error);
        return answer;
    });
}

std::optional<std::vector<std::string>> STWCodeSigningMapping::childBundleIdentifiersForParentIdentifier(
    const std::string& identifier) {
    return _familyQuery(identifier, [&](STWSQLiteDB& db, STWErrorRef* error) {
        return db.childIdentifiersForParentIdentifier(identifier, error);
    });
}

std::optional<std::string> STWCodeSigningMapping::parentIdentifierForChildIdentifier(const std::string& identifier) {
    return _familyQuery(identifier, [&](STWSQLiteDB& db, STWErrorRef* error) {
        return db.parentIdentifierForChildIdentifier(identifier, error);
    });
}

std::optional<std::vector<std::string>> STWCodeSigningMapping::identifiersWithError(STWErrorRef* error) {
    return _queue->syncResult([&] { return _codeSigningMappingDB->identifiersWithError(error); });
}

// MARK: - Remembered registrations

std::optional<STWCodeSigningMapping::_Registration>
STWCodeSigningMapping::_rememberedRegistration(const std::string& identifier) {
    STWLockGuard guard(_registrationsLock);
    auto it = _registrations.find(identifier);
    if (it == _registrations.end())
        return std::nullopt;
    return it->second;
}

void STWCodeSigningMapping::_onQueue_rememberRegistration(const std::string& identifier, _Registration registration) {
    _assertOnQueue(__func__);
    STWLockGuard guard(_registrationsLock);
    // Identifiers come from callers: a full memory starts over rather than growing.
    if (_registrations.size() >= _maxRegistrations)
        _registrations.clear();
    _registrations[identifier] = std::move(registration);
}

void STWCodeSigningMapping::_onQueue_forgetRegistration(const std::optional<std::string>& identifier) {
    _assertOnQueue(__func__);
    STWLockGuard guard(_registrationsLock);
    if (identifier) {
        _registrations.erase(*identifier);
        _dataContainerClasses.erase(*identifier);
    } else {
        _registrations.clear();
        _dataContainerClasses.clear();
    }
}
