// Which code-signing information (above all the entitlements) goes with each code-signing
// identifier: what the installer tells the daemon for every installed app, plug-in or
// placeholder, and what clients register of their own. Backed by the code-signing
// database, it answers the queries the rest of the daemon asks of entitlements (data
// container class, parent and children, group identifiers, system container) and, when an
// identifier's information changes, works out which group and system containers lost
// their last reference and queues their deletion on the caller's command queue.
//
// One process-wide instance (sharedInstance()). Every database access runs on its serial
// queue "com.vorlane.Stowly.EntitlementQueue": public methods submit synchronously, the
// _onQueue_ methods assert that they run there. Lock order: a caller may hold identifier
// locks and the container cache's lock when it calls in; code on the queue never calls
// into the container cache nor takes an identifier lock (container look-ups, as in the
// on-demand migration and the invalidation sweep, run off the queue). Deletions are only
// queued: the request runs its command queue after the mapping's work is done.
//
// Updates answer a daemon code (1 success, 18 no identifier, 40 exception, 60 list counts
// differ, 66 database failure).
#pragma once

#include "Daemon/CodeSigning/STWCodeSigningEntry.h"
#include "Daemon/CodeSigning/STWSQLiteDB.h"
#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"

#include <cstdint>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

class STWCommandQueue;
class STWMetadata;
class STWQueue;

// Group types: 0 application groups (class 7), 1 system groups (class 13).
enum STWGroupType : int64_t {
    STWGroupTypeApplication = 0,
    STWGroupTypeSystem = 1,
};

// How many stored entries name each group identifier; built fresh on every use.
using STWReferenceCountSet = std::unordered_map<std::string, int64_t>;
using STWGroupIdentifierList = std::vector<std::string>;

namespace STWEntitlementKey {
inline constexpr const char* entitlements = "com.vorlane.Stowly.Entitlements";
inline constexpr const char* applicationGroups = "com.vorlane.security.application-groups";
inline constexpr const char* systemGroups = "com.vorlane.security.system-groups";
inline constexpr const char* systemGroupContainers = "com.vorlane.security.system-group-containers";
inline constexpr const char* systemContainer = "com.vorlane.security.system-container";
} // namespace STWEntitlementKey

class STWCodeSigningMapping {
public:
    // Created on first use with the database in the library directory; the legacy mapping
    // file is migrated into it then. nullptr (logged, and tried again on the next call) when
    // the database cannot be opened.
    static std::shared_ptr<STWCodeSigningMapping> sharedInstance();
    // Runs the file-to-database migration on `queue` before returning.
    STWCodeSigningMapping(std::shared_ptr<STWUserIdentityCache> userIdentityCache, std::shared_ptr<STWQueue> queue,
                          std::unique_ptr<STWSQLiteDB> mappingDB);
    STWCodeSigningMapping(const STWCodeSigningMapping&) = delete;
    STWCodeSigningMapping& operator=(const STWCodeSigningMapping&) = delete;

    // "com.vorlane.Stowly.EntitlementQueue", the shared mapping's queue: code that must
    // never run on it (the container cache) asks it whether it does.
    static const std::shared_ptr<STWQueue>& sharedQueue();
    const std::shared_ptr<STWQueue>& queue() const { return _queue; }
    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }
    // The database; only to be used on queue().
    STWSQLiteDB& codeSigningMappingDB() { return *_codeSigningMappingDB; }

    // MARK: Updates

    // Stores `info` (nullopt: forget the identifier) with the options' class, parent and
    // flags. Groups the old entitlements named and the new ones do not are released
    // through `commandQueue`; an unchanged entry writes nothing.
    uint64_t processCodeSigningInfo(const std::optional<STWValue::Dictionary>& info,
                                    const std::optional<std::string>& identifier,
                                    const std::optional<STWValue::Dictionary>& options,
                                    STWCommandQueue& commandQueue);
    // A client's own entitlements; never overrides what the installer provided. A memory
    // hit when nothing changed since the last call for the identifier.
    uint64_t processCallerRegisteredEntitlements(const STWValue::Dictionary& entitlements,
                                                 const std::optional<std::string>& identifier,
                                                 STWCommandQueue& commandQueue);
    // Forgets every child (in stored order), then the identifier; failures are logged.
    void removeCodeSigningDictionariesForIdentifierAndItsChildren(const std::string& identifier,
                                                                  STWCommandQueue& commandQueue);
    bool invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier, STWErrorRef* error);
    bool invalidateCodeSigningInfoForIdentifier(const std::string& identifier, STWErrorRef* error);
    // Invalidates every entry whose app has no bundle container any more, except entries
    // registered by a caller and plug-ins with a parent. Takes the daemon-wide write lock.
    uint64_t invalidateCodeSigningInfoForAppsWithoutBundleContainer();
    bool removeAllAdvanceCopiesWithError(STWErrorRef* error);

    // MARK: Queries

    // nullptr when absent (67, not logged) or unreadable (logged).
    std::shared_ptr<const STWCodeSigningEntry> codeSigningEntryForIdentifier(const std::string& identifier,
                                                                             STWErrorRef* error);
    // The info for an external request: hidden for placeholders, advance copies and
    // invalid entries.
    std::optional<STWValue::Dictionary> getCodeSigningInfoForIdentifier(const std::string& identifier);
    // The stored entitlements, whatever the entry's state; on a miss, the cached info of the
    // app's bundle container is migrated in. Never call from the queue.
    std::optional<STWValue::Dictionary> entitlementsForIdentifier(const std::string& identifier);
    bool identifierHasCallerRegisteredEntitlements(const std::string& identifier);
    // The recorded data-container class (0 when none is). Asked on every upcall, so it is
    // answered from memory after the first time, until the identifier's entry is written.
    uint64_t dataContainerTypeForIdentifier(const std::string& identifier);
    bool identifierHasSystemContainer(const std::string& identifier);
    std::optional<STWGroupIdentifierList> appGroupIdentifiersForIdentifier(const std::string& identifier);
    // Only identifiers with the "systemgroup." prefix.
    std::optional<STWGroupIdentifierList> systemGroupIdentifiersForIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> childBundleIdentifiersForParentIdentifier(const std::string& identifier);
    std::optional<std::string> parentIdentifierForChildIdentifier(const std::string& identifier);
    std::optional<std::vector<std::string>> identifiersWithError(STWErrorRef* error);
    std::optional<STWReferenceCountSet> copyReferenceCountSetOfType(STWGroupType type);

    // MARK: Group identifiers from entitlements

    // A string is a one-element list, an array only when all its elements are strings;
    // duplicates go. nullopt when missing or of another type.
    static std::optional<STWGroupIdentifierList>
    _copyApplicationGroupEntitlementForIdentifier(const std::string& identifier,
                                                  const STWValue::Dictionary& entitlements, const char* groupKey);
    static std::optional<STWGroupIdentifierList> _appGroupIdentifiersForIdentifier(
        const std::string& identifier, const std::optional<STWValue::Dictionary>& entitlements);
    static std::optional<STWGroupIdentifierList> _systemGroupIdentifiersForIdentifier(
        const std::string& identifier, const std::optional<STWValue::Dictionary>& entitlements);
    // The system-group derivation without the prefix rule: what counts references.
    static std::optional<STWGroupIdentifierList>
    _unfilteredSystemGroupIdentifiers(const std::string& identifier, const STWValue::Dictionary& entitlements);

    // MARK: On the queue

    uint64_t _onQueue_processCodeSigningInfo(const std::optional<STWValue::Dictionary>& info,
                                             const std::string& identifier,
                                             const std::optional<STWValue::Dictionary>& options,
                                             const std::optional<STWValue::Dictionary>& oldEntitlements,
                                             STWCommandQueue& commandQueue);
    // Entries without an info dictionary stand for "no entry": the stored one is deleted.
    STWErrorRef _onQueue_setCodeSigningDictionaryValues(const std::vector<STWCodeSigningEntry>& entries,
                                                        const std::vector<std::string>& identifiers);
    STWReferenceCountSet _onQueue_copyReferenceCountSetOfType(STWGroupType type);
    void _onQueue_handleChangeFromOldGroupContainerIds(const std::optional<STWGroupIdentifierList>& oldIds,
                                                       const std::optional<STWGroupIdentifierList>& newIds,
                                                       STWGroupType type, STWCommandQueue& commandQueue);
    void _onQueue_removeReferenceForGroupIdentifiers(const STWGroupIdentifierList& identifiers, STWGroupType type,
                                                     STWCommandQueue& commandQueue);
    void _onQueue_removeGroupContainersIfNeededforUserIdentity(const STWUserIdentityRef& userIdentity,
                                                               STWContainerClass groupContainerClass,
                                                               const STWGroupIdentifierList& identifiers,
                                                               STWReferenceCountSet referenceCounts,
                                                               STWCommandQueue& commandQueue);
    void _onQueue_migrateFromMappingFileToDBIfNecessary();
    static std::optional<STWValue::Dictionary> _readCodeSigningMappingFromDiskAtURL(const std::filesystem::path& url);

    // MARK: Migrations of what older daemons kept elsewhere

    // Takes in, once each, the group identifiers of data containers (single-user devices
    // only), the legacy entitlements file and the code-signing info cached in bundle
    // containers, then sweeps the application group containers that no entry references
    // (single-user devices only) through `commandQueue`. Holds the daemon-wide identifier
    // lock for writing throughout; every failure is logged and the work goes on. Never
    // call from the queue.
    void performAllCodeSigningMigrationAndReconciliationWithCommandQueue(STWCommandQueue& commandQueue);
    // The steps of the above, each recorded in the system migration status store (the
    // legacy file goes once migrated). Called with the daemon-wide write lock held.
    void migrateAppGroupIdsFromDataContainersToFile();
    void _onQueue_migrateAppGroupIdsFromDataContainersToFileUsingContainers(
        const std::vector<std::shared_ptr<const STWMetadata>>& containers);
    void _onQueue_migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    void migrateCachedCodeSigningInfoFromBundleContainersToMapping();
    void _onQueue_migrateCachedCodeSigningInfoFromBundleContainersToMappingWithContainers(
        const std::vector<std::shared_ptr<const STWMetadata>>& containers, STWContainerClass containerClass);

    // The entries a legacy entitlements file stands for, one per identifier, in key order:
    // its entitlements as the info, class 0, the children, placeholder and registered-by-
    // caller flags of the bookkeeping dictionaries, invalid unless registered by a caller.
    // Malformed parts are logged and skipped: an identifier whose entitlements are not a
    // dictionary, a bookkeeping key that is not one, a child list that is not an array of
    // strings. Pure: no database, no files.
    static std::vector<std::pair<std::string, STWCodeSigningEntry>>
    _codeSigningEntriesFromLegacyEntitlements(const STWValue::Dictionary& legacyEntitlements);
    // The code-signing info an older daemon cached in a bundle container's metadata, with
    // its "Entitlements" under the key the mapping reads; nullopt when the container has
    // none or it is not a dictionary.
    static std::optional<STWValue::Dictionary> _codeSigningInfoFromCachedInfoOfContainer(const STWMetadata& container);

    // The legacy files in the library directory.
    static constexpr const char* legacyMappingFileName = "stw_code_signing_info.plist";
    static constexpr const char* legacyEntitlementsFileName = "stw_entitlements.plist";

private:
    // What a caller registration found last time, so that an unchanged one costs no
    // database read.
    struct _Registration {
        bool installerProvided = false;
        STWValue::Dictionary entitlements;
    };
    static constexpr size_t _maxRegistrations = 4096;

    std::shared_ptr<STWCodeSigningEntry> _onQueue_entryForIdentifier(const std::string& identifier,
                                                                     STWErrorRef* error);
    void _assertOnQueue(const char* function) const;
    // Forgets the remembered registration and data-container class of `identifier` (every
    // one, when nullopt); runs on the queue with every write.
    void _onQueue_forgetRegistration(const std::optional<std::string>& identifier);
    std::optional<_Registration> _rememberedRegistration(const std::string& identifier);
    void _onQueue_rememberRegistration(const std::string& identifier, _Registration registration);
    std::optional<STWValue::Dictionary> _migrateEntitlementsFromBundleContainer(const std::string& identifier);
    // Runs a parent or children query on the queue, logging failures other than "not found".
    template <class Query>
    auto _familyQuery(const std::string& identifier, const Query& query);

    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
    std::shared_ptr<STWQueue> _queue;
    // Touched only on _queue.
    std::unique_ptr<STWSQLiteDB> _codeSigningMappingDB;
    // Read by the dispatcher's threads, written on _queue; a leaf lock.
    STWMutex _registrationsLock;
    std::unordered_map<std::string, _Registration> _registrations STW_GUARDED_BY(_registrationsLock);
    // Remembered on the queue after a read, like the registrations; as bounded.
    std::unordered_map<std::string, uint64_t> _dataContainerClasses STW_GUARDED_BY(_registrationsLock);
};
