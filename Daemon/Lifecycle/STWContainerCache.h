// Which containers of a class exist for a user identity, and where, without walking the
// file system on every request.
//
// One class cache per (user identity, class), kept apart for live and transient containers:
// a hash map from container identifier to its metadata record. A class cache is built from
// disk on first use by listing the class directory and reading every container's metadata
// file with full validation; after that create-or-lookup, deletion and replace keep it up to
// date through add and remove. A look-up checks that the record's metadata file is still
// there and drops a record whose file vanished behind the daemon's back (reported once as
// code 44, then as not found).
//
// That check runs on every look-up (three per kernel upcall), so the class cache keeps the
// class directory it was built from open and looks for an entry's metadata file beneath it:
// two path components instead of the whole path. Only a miss there is final after the
// whole path missed too; when the whole path finds the file, the class directory was
// replaced since it was opened, and it is opened again. (A class directory moved away whole,
// with its containers intact, is not noticed that way: only root could move it, and the
// daemon never does.)
//
// The cache is also the one place that pushes container paths to the sandbox mapping store:
// data, app-group and system containers are registered under their identifier when they are
// added or found by a rebuild, and withdrawn when they are removed.
//
// One process-wide instance (sharedInstance()); its lock guards every class cache and is
// held while a class cache is built. Callers serialise create and delete of one identity
// with the identifier locks. Exceptions never leave a public operation: they become code 40.
#pragma once

#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"
#include "common/STWFileDescriptor.h"
#include "common/STWThreadSafety.h"
#include "platform/STWSandboxMappingStore.h"

class STWQueue;

#include <atomic>
#include <exception>
#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <unordered_map>
#include <vector>

class STWContainerCache {
public:
    static std::shared_ptr<STWContainerCache> sharedInstance();

    // The registration decision asks the shared code-signing mapping for the parents of
    // plug-ins (see _parentIdentifierForChildIdentifier).
    explicit STWContainerCache(std::shared_ptr<STWUserIdentityCache> userIdentityCache);
    STWContainerCache(const STWContainerCache&) = delete;
    STWContainerCache& operator=(const STWContainerCache&) = delete;

    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }

    // The record of the identity's container, or nullptr and an error: 43 the class cache
    // could not be built, 21 no such container (not logged), 47 a record without a usable
    // path, 44 the metadata file vanished (the record is dropped, so the next look-up
    // answers 21). `updateSandbox` pushes the mappings of a class cache built by this call.
    STWMetadataRef containerForContainerIdentity(const STWContainerIdentityRef& identity, bool transient,
                                                 bool updateSandbox, STWErrorRef* error);
    // The live record whose UUID is the identity's, else the transient one, else nullptr.
    // The record's transient() tells which.
    STWMetadataRef containerForContainerIdentity(const STWConcreteContainerIdentityRef& identity);

    // Every record of the class for the identity; for the unspecific identity, those of every
    // accessible user identity. Records whose metadata file vanished are dropped (and
    // removed from the cache). Unordered.
    std::optional<std::vector<STWMetadataRef>> allContainersForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                            STWContainerClass contentClass,
                                                                            bool transient, STWErrorRef* error);
    std::optional<std::vector<STWMetadataRef>> allContainersForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                            STWContainerClass contentClass,
                                                                            bool transient, bool populateSandboxCache,
                                                                            STWErrorRef* error);

    // Inserts or replaces the record of metadata's identifier; the cache keeps a record
    // whose url() is `url` and transient() is `transient`. With `updateSandbox`, a live
    // container's mapping is pushed (a push failure is logged, never returned).
    bool addContainerMetadata(const STWMetadataRef& metadata, const std::filesystem::path& url, bool transient,
                              bool updateSandbox, STWErrorRef* error);
    // Removes the identifier's record (an absent record is no error) and withdraws a live
    // container's mapping.
    bool removeContainerForUserIdentity(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass,
                                        const std::string& identifier, bool transient, STWErrorRef* error);

    // Pushes (url given) or withdraws (nullopt) the sandbox mapping of a container. Bundle
    // classes have none and succeed; unsupported classes fail.
    bool setSandboxContainerMappingForUserIdentity(const STWUserIdentityRef& userIdentity, const std::string& identifier,
                                                   STWContainerClass containerClass,
                                                   const std::optional<std::filesystem::path>& url);
    // Whether a container of the class gets a sandbox mapping for this identity.
    bool shouldRegisterSandboxMappingWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                      const std::string& identifier, STWContainerClass containerClass);
    bool _lock_shouldRegisterSandboxMappingWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                            const std::string& identifier,
                                                            STWContainerClass containerClass) STW_REQUIRES(_cacheLock);

    // Whether a directory entry may be a container of the class: its name is a UUID, or,
    // for system and system group containers, a well-known identifier.
    bool containerURL(const std::filesystem::path& url, STWContainerClass isValidForContainerClass) const;

    // "Data/System" for classes without a user identity, "[501]-Data/Application" otherwise.
    static std::string classCacheKey(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass);

private:
    // classCacheKey() into `key`, reusing its memory.
    static void _classCacheKey(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass, std::string* key);

private:
    // The directory a class cache was built from, open, and its path as the URLs of its
    // entries begin (ending in a separator). Shared, so that a look-up can use it after
    // the cache lock is released while another one replaces it.
    struct ClassDirectory {
        std::string prefix;
        STWFileDescriptor descriptor;
    };
    using ClassDirectoryRef = std::shared_ptr<const ClassDirectory>;

    struct ClassCache {
        std::unordered_map<std::string_view, STWMetadataRef> records;
        ClassDirectoryRef directory;
    };

    // The sandbox mappings a rebuild pushes: handed in batches, in order, to the rebuild
    // mapping queue, and all done once finish() (or the destructor) returns. Each batch
    // asks the store once which mappings are current already and pushes the others.
    // finish() rethrows an exception raised by a push; the pushes after it are not made.
    class RebuildMappingPushes {
    public:
        RebuildMappingPushes(STWContainerCache& cache, STWContainerClass contentClass);
        ~RebuildMappingPushes();
        RebuildMappingPushes(const RebuildMappingPushes&) = delete;
        RebuildMappingPushes& operator=(const RebuildMappingPushes&) = delete;

        void add(STWMetadataRef record);
        void finish();

    private:
        // Large enough that the queue wakes seldom (with one core, each wake-up is a switch
        // away from the reads), small enough that the last batch adds little after them.
        static constexpr size_t kBatchSize = 512;
        void _send();
        void _push(const std::vector<STWMetadataRef>& batch);
        void _drain();

        STWContainerCache& _cache;
        const STWContainerClass _contentClass;
        std::vector<STWMetadataRef> _batch;
        bool _queued = false; // batches queued and maybe not yet run
        // Set on the queue, read once a drain has waited for it.
        std::exception_ptr _exception;
    };

    // The non-recursive cache lock, with its owner recorded so that _lock_ methods can check
    // that their caller holds it.
    class STW_CAPABILITY("mutex") CacheLock {
    public:
        void lock() STW_ACQUIRE() {
            _mutex.lock();
            _owner.store(std::this_thread::get_id(), std::memory_order_relaxed);
        }
        void unlock() STW_RELEASE() {
            _owner.store(std::thread::id(), std::memory_order_relaxed);
            _mutex.unlock();
        }
        // Stops the process unless the calling thread holds the lock; tells the analysis
        // that it does where it cannot see it (in a callback, say).
        void assertHeld(const char* function) const STW_THREAD_ANNOTATION(assert_capability(this));

    private:
        std::mutex _mutex;
        std::atomic<std::thread::id> _owner{};
    };

    // The class cache, built from disk when missing; nullptr and the listing error when the
    // class directory cannot be listed (nothing is cached then).
    ClassCache* _lock_getCacheForUserIdentity(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass,
                                              bool transient, bool populateSandboxCache, STWErrorRef* error) STW_REQUIRES(_cacheLock);
    ClassCache* _lock_getCacheForUserIdentity(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass,
                                              bool transient, STWErrorRef* error) STW_REQUIRES(_cacheLock);

    STWMetadataRef _containerForContainerIdentity(const STWContainerIdentityRef& identity, bool transient,
                                                  bool updateSandbox, STWErrorRef* error);
    std::optional<std::vector<STWMetadataRef>> _allContainersForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                             STWContainerClass contentClass,
                                                                             bool transient, bool populateSandboxCache,
                                                                             STWErrorRef* error);
    bool _addContainerMetadata(const STWMetadataRef& metadata, const std::filesystem::path& url, bool transient,
                               bool updateSandbox, STWErrorRef* error);
    // Removes the identifier's record; with `onlyRecord`, only when the cached record is
    // still that one, so that repairing a stale record never drops its successor.
    bool _removeContainerForUserIdentity(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass,
                                         const std::string& identifier, bool transient,
                                         const STWMetadataRef& onlyRecord, STWErrorRef* error);
    bool _setSandboxContainerMappingForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                    const std::string& identifier, STWContainerClass containerClass,
                                                    const std::optional<std::filesystem::path>& url);
    // The store item of a container's mapping; nullopt for a class without one or without
    // a user identity.
    static std::optional<STWSandboxMappingItem> _sandboxMappingItem(const STWUserIdentityRef& userIdentity,
                                                                    const std::string& identifier,
                                                                    STWContainerClass containerClass);
    // The stale-record check shared by the single and the bulk look-up: nullptr and the
    // (logged) error when the record has no usable path or its metadata file is gone (then
    // the record is dropped). `directory` is that of the record's class cache.
    STWMetadataRef _validatedRecord(const STWMetadataRef& record, const ClassDirectoryRef& directory, bool transient,
                                    STWErrorRef* error);
    // Whether the record's metadata file at `metadataFile` (its URL's) is still the one the
    // record was read from: beneath `directory` when the container is one of its entries,
    // else, or when not found there, by the whole path (reopening a replaced directory).
    bool _isMetadataFilePresent(const STWMetadata& record, const std::string& metadataFile,
                                const ClassDirectoryRef& directory);
    // Opens the class directory again after it was replaced, for the caches that still
    // hold `replaced`.
    void _reopenClassDirectory(const STWMetadata& record, const ClassDirectoryRef& replaced);

    // containerURL() on the directory entry's name alone.
    bool _isContainerName(const std::string& name, STWContainerClass containerClass) const;

    // Where the cache consults the code-signing mapping.
    void _assertNotOnCodeSigningMappingQueue() const;
    std::optional<std::string> _parentIdentifierForChildIdentifier(const std::string& identifier) const;
    bool _isWellKnownContainerName(const std::string& name, STWContainerClass containerClass) const;

    static void _storeRecord(ClassCache& cache, STWMetadataRef record);

    CacheLock _cacheLock;
    std::unordered_map<std::string, ClassCache> _liveContainerCache STW_GUARDED_BY(_cacheLock);
    std::unordered_map<std::string, ClassCache> _transientContainerCache STW_GUARDED_BY(_cacheLock);
    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
    // Runs the sandbox mapping pushes of rebuilds (see RebuildMappingPushes).
    std::shared_ptr<STWQueue> _rebuildMappingQueue;
};
