// The context of one request's container work: the caller, the entitlement decisions
// the dispatcher made, the caller's lookup entitlement in a sanitised form, and the
// request's command queue. The daemon's own work (start-up, setup, cleanup, upcalls)
// runs on privileged connections.
#pragma once

#include "common/STWFileDescriptor.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWCommandQueue.h"
#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "Daemon/Request/STWClientIdentity.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"
#include "platform/STWQueue.h"

#include <atomic>
#include <filesystem>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

// The operations live with their subsystems (Daemon/Lifecycle/STWClientConnection+*.cpp:
// create-or-lookup, death row, replace, services, setup); this header is their index.
class STWClientConnection {
public:
    using StringSet = std::set<std::string, std::less<>>;

    // The daemon's own connection: privileged, unrestricted, entitled.
    STWClientConnection();
    STWClientConnection(STWClientIdentityRef clientIdentity, bool entitled, bool allowOtherIdLookup, bool unrestricted,
                        std::optional<STWValue::Dictionary> lookup,
                        std::optional<STWValue::Array> entitledWipeIdentifiers,
                        std::shared_ptr<STWCommandQueue> commandQueue);

    static const std::shared_ptr<STWClientConnection>& sharedClientConnection();
    static std::shared_ptr<STWClientConnection> privilegedClientConnectionWithUserIdentity(STWUserIdentityRef userIdentity);
    // "com.vorlane.stowlyd.background": background work of every connection, one item at
    // a time; each item holds an IPC transaction until it ran.
    static const std::shared_ptr<STWQueue>& _sharedBackgroundQueue();

    // Runs the commands this request queued (see STWCommandQueue).
    bool completeWithError(uint64_t* error);
    bool isEntitledForLookupWithClass(STWContainerClass containerClass, std::string_view identifier);
    std::optional<StringSet> _lookupForContainerClass(STWContainerClass containerClass);
    static StringSet _setOfStringsFromArray(const STWValue::Array& array);

    // The container of `identity`, created first when it does not exist and
    // `createIfNecessary` is set. A new container is built completely in staging
    // (metadata, subdirectories) and moved into its class directory with one rename; a
    // failure leaves nothing in the class directory. A transient container asked for again
    // is retired to death row and made anew, empty. With `useLocking` the daemon-wide
    // identifier lock orders this against every other change of the set of containers.
    // nullptr with the code in `error` on failure.
    std::shared_ptr<STWMetadata> createOrLookupContainerWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                              bool createIfNecessary, bool transient,
                                                                              bool useLocking, uint64_t* error);
    // The same, answering the cache's own record (never to be changed) and whether the
    // container existed, for callers that only read it: a look-up then copies nothing.
    STWMetadataRef createOrLookupContainerRecordWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                      bool createIfNecessary, bool transient,
                                                                      bool useLocking, bool* existed, uint64_t* error);
    // Every container of a class of the caller's user identity.
    std::optional<std::vector<STWMetadataRef>> containersWithClass(STWContainerClass containerClass, bool transient,
                                                                   uint64_t* error);
    std::shared_ptr<STWMetadata> metadataWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                               uint64_t* error);
    // Recreates missing standard subdirectories of an existing container.
    bool recreateDefaultStructureWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                       uint64_t* error);

    // The new container directory `name` in the staging directory open as `stagingfd` (at
    // `url`), owned as its class wants; its descriptor.
    STWFileDescriptor _createTopLevelContainerDirectory(int stagingfd, const std::string& name,
                                                        const std::filesystem::path& url,
                                                        STWContainerClass containerClass, uid_t owner,
                                                        STWErrorRef* error);
    int32_t _dataProtectionClassForContainerMetadata(const STWMetadata& metadata);
    // The standard subdirectories of the class, made beneath the container directory open as
    // `containerfd` (at `url`); a link in place of one is removed, never followed.
    bool _createSubDirectories(int containerfd, const std::filesystem::path& url, const STWMetadata& metadata,
                               STWErrorRef* error);

    // Death row: moves an item into a fresh "temp." directory of death row (a missing item
    // counts as moved) and optionally starts a deletion pass.
    // The directory the item left is synced, unless `options` say otherwise (for garbage
    // that may as well come back after a power cut).
    bool _moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir, bool startDeletionThread,
                                  STWErrorRef* error,
                                  STWFileManagerMoveOptions options = STWFileManagerMoveSyncSourceDirectory);
    // The same for an item found below a directory someone else owns: the entry `name` of
    // `parentfd` moves into a fresh "temp." directory only while it is still the item open
    // as `itemfd` (ESTALE otherwise); the directory it left is synced unless `options` say
    // otherwise, as above. `itemfd` may be an O_PATH descriptor (a link or a FIFO is moved as
    // the entry it is, never opened or followed).
    // With a `batch`, the item goes into the batch's "temp." directory, made by its first
    // move: one directory for many items, which is fine as long as their names differ
    // (the entries of one directory, say).
    class DeathRowBatch;
    bool _moveItemAtToDeathRow(int parentfd, const std::string& name, int itemfd, const std::filesystem::path& url,
                               STWErrorRef* error,
                               STWFileManagerMoveOptions options = STWFileManagerMoveSyncSourceDirectory,
                               DeathRowBatch* batch = nullptr);
    // Items moved into death row one after the other that share one fresh "temp." directory
    // there. A deletion pass leaves the directory alone while the batch lives (and so while
    // any single move fills its own): nothing arrives in a directory being removed. A pass
    // started after the batch is gone removes it.
    class DeathRowBatch {
    public:
        DeathRowBatch();
        ~DeathRowBatch();
        DeathRowBatch(const DeathRowBatch&) = delete;
        DeathRowBatch& operator=(const DeathRowBatch&) = delete;
        struct Slot;

    private:
        friend class STWClientConnection;
        std::unique_ptr<Slot> _slot;
    };
    static bool _removeItemOrMoveToTempAtURL(const std::filesystem::path& url, STWErrorRef* error);
    // The same for the entry `name` of the directory open as `dirfd` (death row's), which
    // `url` names.
    static bool _removeItemOrMoveToTempAt(int dirfd, const std::string& name, const std::filesystem::path& url,
                                          STWErrorRef* error);
    // Empties death row on the death-row queue, but for the "temp." directories that moves
    // are still filling; the completion gets 1 or the last error's code.
    static void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);

    // Deletion (Lifecycle/STWClientConnection+Deletion.cpp). A container to delete is looked
    // up now and moved into death row by a stage-for-delete command when the request
    // completes. A wipe replaces a per-user container with a new empty one that keeps its
    // path and UUID; only unrestricted callers wipe any, others only class 4 containers of
    // identifiers they are entitled to wipe (55).
    bool deleteContainerWithContainerIdentity(const STWContainerIdentityRef& identity, bool transient,
                                              uint64_t* error);
    void deleteDataContainerContentWithContainerIdentity(const STWContainerIdentityRef& identity, uint64_t* error);

    // Replace (Lifecycle/STWClientConnection+Replace.cpp): puts the container of
    // `newIdentity` in the place of the container of `oldIdentity` (nullptr: no old
    // container; the new one becomes live under its own UUID), optionally keeping the old
    // UUID and path. A journal written before the first rename lets the next start undo a
    // replace that a crash cut short. The code in `error` on failure.
    bool replaceContainerIdentity(const STWConcreteContainerIdentityRef& oldIdentity,
                                  const STWConcreteContainerIdentityRef& newIdentity, bool preserveOldUUID,
                                  bool startDeletionThread, uint64_t* error);
    // The four paths of one replace, as its journal holds them.
    struct ReplaceFileInfo {
        std::filesystem::path oldURL, newURL, stagingURL, destURL;
    };
    static bool _writeToDiskReplaceAt(const std::filesystem::path& url, const ReplaceFileInfo& info,
                                      STWErrorRef* error);
    // nullopt with `error` for an unreadable or invalid journal; nullopt without one for a
    // file that is not a dictionary.
    static std::optional<ReplaceFileInfo> _readAndValidateReplaceFileAtUrl(const std::filesystem::path& url,
                                                                           STWErrorRef* error);
    // Undoes every replace whose journal a stop left behind: the old container goes back from
    // staging when neither it nor the new one is in place; the journal goes to death row.
    bool _recoverFromReplaceOperationsWithError(STWErrorRef* error);

    // Group containers (CodeSigning/STWClientConnection+Groups.cpp): every group container
    // of class 7 or 13 that `ownerIdentifier` is entitled to, for `userIdentity`, created
    // when missing. The caller must be the owner, may look up other identifiers, be
    // unrestricted, carry a lookup entitlement for (class, owner) or be let through by the
    // well-known list; otherwise 55. A group whose container cannot be made is left out.
    std::optional<std::map<std::string, STWMetadataRef>>
    groupContainersForOwnerIdentifier(const std::string& ownerIdentifier, const STWUserIdentityRef& userIdentity,
                                      STWContainerClass groupContainerClass, uint64_t* error);

    // Services on one existing container (Lifecycle/STWClientConnection+Services.cpp): its
    // info values (nil removes the key; 24 for a missing key), a fresh UUID directory, its
    // disk usage (a bundle's computed once while fast sizing is off), the private assets
    // directory in an app's Library and the removal of one asset, content staged inside a
    // system group container, and the retry self-test that exits the daemon. Each takes
    // the lock its effect needs; below the container directory everything is resolved
    // beneath its descriptor and nothing leads out of it.
    bool setInfoValue(const std::optional<STWValue>& value, const STWValue& forKey,
                      const STWConcreteContainerIdentityRef& containerIdentity, bool useLocking, uint64_t* error);
    std::optional<STWValue> infoValueForKey(const STWValue& key,
                                            const STWConcreteContainerIdentityRef& containerIdentity,
                                            bool useLocking, uint64_t* error);
    bool regenerateDirectoryUUIDWithContainerIdentity(const STWConcreteContainerIdentityRef& identity,
                                                      uint64_t* error);
    uint64_t diskUsageWithContainerIdentity(const STWConcreteContainerIdentityRef& identity, uint64_t* error);
    std::optional<std::string> userManagedAssetsPathWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                          bool isRelative, bool createIfNecessary,
                                                                          bool* existed, uint64_t* error);
    bool deleteUserManagedAssetWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                     const std::optional<std::string>& relativePath, uint64_t* error);
    std::optional<std::filesystem::path> stageSharedContentForIdentifier(const STWValue& identifier,
                                                                         const STWValue& sourceRelativePath,
                                                                         const STWValue& destRelativePath,
                                                                         uint64_t* error);
    bool retryTestWithNumCrashes(uint64_t numCrashes, uint64_t* error);

    // Start-up (Lifecycle/STWClientConnection+Setup.cpp), on the daemon's own connection,
    // which lives for the process. The first start after power-on runs rebootStowlySetup
    // (build upgrade, restored system containers, group reconcile on multi-user devices),
    // every start stowlySetup (replace journals, pending protection changes); both run
    // before the first request. The cleanups list what they sweep at once (the first-boot
    // one also sends the transient directories to death row then) and return; the sweeps
    // run on the background queue while requests are served, each cleanup holding an IPC
    // transaction until its completion ran. The first-boot cleanup sends transient
    // containers and whatever in a class directory is not a container to death row; the
    // every-start cleanup sends staging leftovers there and then empties death row (its
    // completion gets the pass's code). Nothing is followed below a directory an app owns:
    // entries are listed and moved through descriptors.
    void rebootStowlySetup();
    void stowlySetup();
    void rebootStowlyCleanupWithCompletion(std::function<void()> completion);
    void stowlyCleanupWithCompletion(std::function<void(uint64_t)> completion);
    // The entries of one directory as listed through its descriptor, kept open for the
    // sweep that acts on them later.
    struct DirectoryListing {
        std::filesystem::path url;
        std::shared_ptr<STWFileDescriptor> fd;
        std::vector<STWFileManager::DirectoryItem> items;
    };
    // The directory at `url`, opened without following a link below `trustedAncestor`
    // (empty: only the last component), and its entries; nullptr with the error otherwise.
    static std::shared_ptr<const DirectoryListing> _listDirectoryForCleanup(const std::filesystem::path& url,
                                                                            const std::filesystem::path& trustedAncestor,
                                                                            STWErrorRef* error);
    // Moves to death row every entry of a class directory's listing that is not a container
    // of the class: anything but a directory, a directory whose name is no container name,
    // and one without a metadata file (one whose metadata state cannot be read stays).
    void _cleanupOrphanedDataForDirectories(const DirectoryListing& directories, STWContainerClass containerClass);
    void _cleanupOprhanedCodeSigningMappingData();
    // A build upgrade gives every system and system group container that is not well known
    // a new UUID directory.
    void _regenerateAllSystemContainerPaths();

    // Restored system containers (Lifecycle/STWClientConnection+SystemContainerRestore.cpp):
    // the backup directories left by a restore are renamed to "inprogress" and each
    // container in them is installed item by item over the live container; an item that
    // cannot be installed is kept in the failed-items directory beside them.
    void _moveSystemContainersIntoPlace();
    void _moveSystemContainerIntoPlace(const std::filesystem::path& restored, STWContainerClass containerClass);
    static void _moveFailedPathAside(const std::filesystem::path& item, const std::filesystem::path& failedDirectory);

    const std::shared_ptr<STWQueue>& backgroundQueue() const { return _backgroundQueue; }
    bool entitled() const { return _entitled; }
    void setEntitled(bool v) { _entitled = v; }
    bool allowOtherIdLookup() const { return _allowOtherIdLookup; }
    void setAllowOtherIdLookup(bool v) { _allowOtherIdLookup = v; }
    bool allowGroupIdLookup() const { return _allowGroupIdLookup; }
    void setAllowGroupIdLookup(bool v) { _allowGroupIdLookup = v; }
    bool unrestricted() const { return _unrestricted; }
    void setUnrestricted(bool v) { _unrestricted = v; }
    const STWClientIdentityRef& clientIdentity() const { return _clientIdentity; }
    const std::shared_ptr<STWCommandQueue>& commandQueue() const { return _commandQueue; }
    // Always the client identity's bundle identifier, whatever was set.
    std::optional<std::string> clientBundleIdentifier() const;
    void setClientBundleIdentifier(std::optional<std::string> identifier);
    std::optional<STWValue::Array> entitledWipeIdentifiers() const;
    void setEntitledWipeIdentifiers(std::optional<STWValue::Array> identifiers);
    const std::optional<STWValue::Dictionary>& lookup() const { return _lookup; }
    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }

private:
    // The code-signing mapping marks a replaced app and its children invalid.
    static bool _invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                      STWErrorRef* error);
    // The code of an error for a client: its own in the daemon's domain, else 41 (logged).
    static uint64_t _codeOfError(const STWErrorRef& error);
    static void _reportException(const char* function);
    // createOrLookupContainerRecordWithContainerIdentity without the exception guard; the
    // code goes to `code` (never null).
    STWMetadataRef _createOrLookupContainerWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                 bool createIfNecessary, bool transient,
                                                                 bool useLocking, bool* existed, uint64_t* code);
    // Runs `body`, turning an exception into code 40 (an internal image stops instead, so
    // the report is not lost): no exception leaves a client operation.
    // The body is called as it is, not through a std::function: its captures would be a
    // heap allocation on every look-up.
    template <class T, class Body>
    static T _catchingExceptions(const char* function, uint64_t* error, T failure, Body&& body) {
        try {
            return body();
        } catch (...) {
            _reportException(function);
            *error = STWErrorException;
            return failure;
        }
    }

    mutable STWMutex _lock;
    // The lookup entitlement's identifiers by class word, sanitised on first use.
    std::map<std::string, StringSet, std::less<>> _sanitizedLookup STW_GUARDED_BY(_lock);
    std::shared_ptr<STWQueue> _backgroundQueue;
    std::atomic<bool> _entitled;
    std::atomic<bool> _allowOtherIdLookup;
    std::atomic<bool> _allowGroupIdLookup{false};
    std::atomic<bool> _unrestricted;
    STWClientIdentityRef _clientIdentity;
    std::shared_ptr<STWCommandQueue> _commandQueue;
    std::optional<std::string> _clientBundleIdentifier STW_GUARDED_BY(_lock);
    std::optional<STWValue::Array> _entitledWipeIdentifiers STW_GUARDED_BY(_lock);
    std::optional<STWValue::Dictionary> _lookup;
    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
};
