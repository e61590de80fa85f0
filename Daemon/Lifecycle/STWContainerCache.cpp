#include "Daemon/Lifecycle/STWContainerCache.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"
#include "Daemon/CodeSigning/STWWhitelist.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWException.h"
#include "common/STWLog.h"
#include "platform/STWQueue.h"
#include "platform/STWSandboxMappingStore.h"

#include <fcntl.h>
#include <malloc.h>
#include <sys/stat.h>
#include <unordered_set>
#include <utility>

namespace fs = std::filesystem;

namespace {

const char* transientMarker(bool transient) { return transient ? "(transient)" : ""; }

void signpost(const char* interval, bool begin, STWContainerClass containerClass) {
    STW_LOG_DEBUG(STWLogCategory::Cache, "%s %s %llu", begin ? "begin" : "end", interval, containerClass);
}

// Runs one public operation, so that no exception leaves it.
template <class Result, class Body>
Result guarded(const char* function, uint64_t line, STWErrorRef* error, Result failure, Body&& body) {
    try {
        return body();
    } catch (...) {
        STWSetError(error, STWErrorForCurrentException(
                               function, line,
                               STWExceptionReportForImage(STWGlobalConfiguration::sharedInstance()->isInternalImage())));
        return failure;
    }
}

#define STW_CACHE_GUARDED(error, failure, ...) guarded(__func__, __LINE__, error, failure, __VA_ARGS__)

} // namespace

std::shared_ptr<STWContainerCache> STWContainerCache::sharedInstance() {
    static std::shared_ptr<STWContainerCache> instance =
        std::make_shared<STWContainerCache>(STWUserIdentitySharedCache::sharedInstance());
    return instance;
}

STWContainerCache::STWContainerCache(std::shared_ptr<STWUserIdentityCache> userIdentityCache)
    : _userIdentityCache(std::move(userIdentityCache)),
      _rebuildMappingQueue(STWQueue::create("com.vorlane.stowlyd.cache.mappings")) {}

std::string STWContainerCache::classCacheKey(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass) {
    std::string key;
    _classCacheKey(userIdentity, contentClass, &key);
    return key;
}

void STWContainerCache::_classCacheKey(const STWUserIdentityRef& userIdentity, STWContainerClass contentClass,
                                       std::string* key) {
    std::string_view directoryName = STWContainerClassDirectoryName(contentClass);
    key->clear();
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(contentClass)) {
        *key += '[';
        *key += userIdentity ? std::string_view(userIdentity->identifier()) : std::string_view("(null)");
        *key += "]-";
    }
    *key += directoryName;
}

// MARK: - The code-signing mapping

void STWContainerCache::_assertNotOnCodeSigningMappingQueue() const {
    // The registration decision calls into the code-signing mapping, which serialises on its
    // own queue; a cache operation running on that queue would deadlock there.
    if (STWCodeSigningMapping::sharedQueue()->isCurrent())
        STW_FATAL("Container cache operation on the code-signing mapping's queue");
}

std::optional<std::string> STWContainerCache::_parentIdentifierForChildIdentifier(const std::string& identifier) const {
    // Plug-in data containers register under their application's identifier.
    auto mapping = STWCodeSigningMapping::sharedInstance();
    return mapping ? mapping->parentIdentifierForChildIdentifier(identifier) : std::nullopt;
}

bool STWContainerCache::_isWellKnownContainerName(const std::string& name, STWContainerClass containerClass) const {
    // Well-known system (group) containers are named by their identifier instead of a UUID.
    return STWWhitelist::sharedWhitelist()->containerIdIsWellknown(name, containerClass);
}

void STWContainerCache::CacheLock::assertHeld(const char* function) const {
    if (_owner.load(std::memory_order_relaxed) != std::this_thread::get_id())
        STW_FATAL("%s called without the container cache lock", function);
}

// MARK: - Class caches

void STWContainerCache::_storeRecord(ClassCache& cache, STWMetadataRef record) {
    // The key views the record's own identifier, so the old entry (key and record) must go
    // before the new one comes; assigning over it would leave the key pointing into the
    // record it replaced.
    auto it = cache.records.find(record->identifier());
    if (it != cache.records.end())
        cache.records.erase(it);
    std::string_view key = record->identifier();
    cache.records.emplace(key, std::move(record));
}

bool STWContainerCache::containerURL(const fs::path& url, STWContainerClass isValidForContainerClass) const {
    return _isContainerName(url.filename().string(), isValidForContainerClass);
}

bool STWContainerCache::_isContainerName(const std::string& name, STWContainerClass containerClass) const {
    if (STWUUID::fromString(name))
        return true;
    if (containerClass == STWContainerClassDataSystem || containerClass == STWContainerClassSharedSystemGroup)
        return _isWellKnownContainerName(name, containerClass);
    return false;
}

STWContainerCache::RebuildMappingPushes::RebuildMappingPushes(STWContainerCache& cache,
                                                             STWContainerClass contentClass)
    : _cache(cache), _contentClass(contentClass) {}

STWContainerCache::RebuildMappingPushes::~RebuildMappingPushes() {
    // When the rebuild ends early, queued pushes still refer to this object.
    _drain();
}

void STWContainerCache::RebuildMappingPushes::add(STWMetadataRef record) {
    _batch.push_back(std::move(record));
    if (_batch.size() == kBatchSize)
        _send();
}

void STWContainerCache::RebuildMappingPushes::finish() {
    _send();
    _drain();
    // An exception inside a push is one inside the operation that rebuilds.
    if (_exception)
        std::rethrow_exception(std::exchange(_exception, nullptr));
}

void STWContainerCache::RebuildMappingPushes::_send() {
    if (_batch.empty())
        return;
    _cache._rebuildMappingQueue->async([this, batch = std::move(_batch)] {
        if (_exception)
            return;
        try {
            _push(batch);
        } catch (...) {
            _exception = std::current_exception();
        }
    });
    _batch.clear();
    _queued = true;
}

void STWContainerCache::RebuildMappingPushes::_push(const std::vector<STWMetadataRef>& batch) {
    // After a restart the store holds what the last run pushed: one read of each link
    // instead of a removal and a new link. Only the others are pushed.
    constexpr size_t unchecked = SIZE_MAX;
    std::vector<STWSandboxMappingStore::ItemAndPath> items;
    std::vector<size_t> itemOfRecord;
    items.reserve(batch.size());
    itemOfRecord.reserve(batch.size());
    for (const STWMetadataRef& record : batch) {
        auto item = _sandboxMappingItem(record->userIdentity(), record->identifier(), _contentClass);
        itemOfRecord.push_back(item ? items.size() : unchecked);
        if (item)
            items.emplace_back(std::move(*item), record->urlString());
    }
    std::vector<bool> current = STWSandboxMappingStore::sharedInstance()->userStateItemsAre(items);
    for (size_t i = 0; i < batch.size(); ++i) {
        if (itemOfRecord[i] != unchecked && current[itemOfRecord[i]])
            continue;
        const STWMetadataRef& record = batch[i];
        // Without an item this only logs why there is none.
        if (!_cache._setSandboxContainerMappingForUserIdentity(record->userIdentity(), record->identifier(),
                                                               _contentClass, record->url()))
            STW_LOG_ERROR(STWLogCategory::Cache,
                          "Failed to set container mapping during create/lookup operation of %@, %llu",
                          record->identifier(), _contentClass);
    }
}

void STWContainerCache::RebuildMappingPushes::_drain() {
    if (_queued) {
        _cache._rebuildMappingQueue->sync([] {});
        _queued = false;
    }
}

STWContainerCache::ClassCache* STWContainerCache::_lock_getCacheForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                                STWContainerClass contentClass,
                                                                                bool transient, STWErrorRef* error) {
    return _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, true, error);
}

STWContainerCache::ClassCache* STWContainerCache::_lock_getCacheForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                                STWContainerClass contentClass,
                                                                                bool transient,
                                                                                bool populateSandboxCache,
                                                                                STWErrorRef* error) {
    _cacheLock.assertHeld(__func__);

    // Every look-up comes here: the key is made in a buffer kept for the purpose, and only
    // a rebuild takes a string of its own.
    thread_local std::string lookupKey;
    _classCacheKey(userIdentity, contentClass, &lookupKey);
    auto& caches = transient ? _transientContainerCache : _liveContainerCache;
    if (auto it = caches.find(lookupKey); it != caches.end())
        return &it->second;
    std::string key = lookupKey;

    STW_LOG_NOTICE(STWLogCategory::Cache, "Rebuilding container class cache: %@%@", key, transientMarker(transient));
    signpost("RebuildingCache", true, contentClass);

    auto directory = STWGlobalConfiguration::sharedInstance()->containerDirectoryURLForUserIdentity(
        userIdentity, contentClass, transient);
    if (!directory) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                                     static_cast<long>(contentClass)));
        signpost("RebuildingCache", false, contentClass);
        return nullptr;
    }
    auto entries = STWFileManager::defaultManager()->itemsInDirectoryAtURL(*directory, error);
    // Containers are read beneath the class directory's descriptor, so a link that the
    // directory's owner planted anywhere on the way is never followed.
    STWFileDescriptor classDirectory;
    if (entries)
        classDirectory = STWFileManager::defaultManager()->openDirectoryAtURL(
            *directory, STWTrustedAncestorForClass(userIdentity, contentClass), error);
    if (!entries || !classDirectory) {
        signpost("RebuildingCache", false, contentClass);
        return nullptr;
    }

    ClassCache cache;
    cache.records.reserve(entries->size());
    bool pushMappings = populateSandboxCache && !transient;
    // The mappings are pushed on their own queue, in listing order, while the next metadata
    // files are read: a push is a few file-system calls of its own, and done inline they
    // would double the time of a rebuild. All of them are done before the class cache is
    // handed out, so nobody is given a container the sandbox cannot resolve yet.
    RebuildMappingPushes pushes(*this, contentClass);
    for (const STWFileManager::DirectoryItem& entry : *entries) {
        // Containers are always real directories (the reader refuses links too; this only
        // spares it the attempt). The name is checked before a path is built for it.
        if (!entry.isDirectory || !_isContainerName(entry.name, contentClass))
            continue;
        fs::path url = *directory / entry.name;
        // The reader logs why a directory is not a container.
        auto record = STWMetadata::readAndValidateMetadataInDirectory(classDirectory.get(), entry.name, url,
                                                                      userIdentity, true, nullptr);
        if (!record)
            continue;
        record->setTransient(transient);
        // Two directories claiming one identifier: the later one in listing order stays.
        _storeRecord(cache, record);
        if (pushMappings && _lock_shouldRegisterSandboxMappingWithUserIdentity(record->userIdentity(),
                                                                               record->identifier(), contentClass))
            pushes.add(record);
    }
    pushes.finish();
    // The listing was allocated before the records that stay and now lies free beneath
    // them, where the allocator would keep it resident (some 10 MB for a class of 100,000
    // containers). Give those pages back.
    entries.reset();
    malloc_trim(0);
    cache.directory = std::make_shared<const ClassDirectory>(
        ClassDirectory{(*directory / "").native(), std::move(classDirectory)});

    auto inserted = caches.emplace(std::move(key), std::move(cache)).first;
    signpost("RebuildingCache", false, contentClass);
    return &inserted->second;
}

// MARK: - Look-ups

STWMetadataRef STWContainerCache::_validatedRecord(const STWMetadataRef& record, const ClassDirectoryRef& directory,
                                                   bool transient, STWErrorRef* error) {
    // The record's class cache, by name, for the messages of a record that does not pass.
    auto cacheName = [&] { return classCacheKey(record->userIdentity(), record->containerClass()); };
    // Every look-up of a known container comes through here: the path stays text, as
    // splitting it into components costs more than the lstat.
    const std::string& url = record->urlString();
    if (url.empty()) {
        STWSetError(error,
                    STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Cache: %@%@: Invalid URL path string: %@",
                              cacheName(), transientMarker(transient), fs::path(url)));
        return nullptr;
    }
    // The metadata file's path is only meaningful below an absolute container path.
    if (url.front() != '/') {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Cache: %@%@: nil URL from %@",
                                     cacheName(), transientMarker(transient), fs::path(url)));
        return nullptr;
    }
    // Still the very file the record was read from or written to: a container that its app
    // removed, or replaced (by a link to some other container, say), is no longer there.
    std::string metadataFile;
    metadataFile.reserve(url.size() + 1 + std::char_traits<char>::length(STWMetadata::fileName));
    metadataFile = url;
    if (metadataFile.back() != '/')
        metadataFile += '/';
    metadataFile += STWMetadata::fileName;
    if (_isMetadataFilePresent(*record, metadataFile, directory))
        return record;

    // Gone behind the daemon's back: drop the record so that the next look-up answers
    // "not found" instead of handing out a path that is no container.
    STWErrorRef removeError;
    if (!_removeContainerForUserIdentity(record->userIdentity(), record->containerClass(), record->identifier(),
                                         transient, record, &removeError))
        STW_LOG_ERROR(STWLogCategory::Cache, "Failed to remove from cache user: %@, id: %@, class: %llu, transient: %d : %@",
                      record->userIdentity(), record->identifier(), record->containerClass(),
                      static_cast<int>(transient), removeError);
    STWSetError(error, STW_ERROR(STWErrorMetadataMissing, nullptr,
                                 "Cache: %@%@: INCONSISTENT-No Metadata at: %@ for id: %@, class: %llu", cacheName(),
                                 transientMarker(transient), metadataFile, record->identifier(),
                                 record->containerClass()));
    return nullptr;
}

bool STWContainerCache::_isMetadataFilePresent(const STWMetadata& record, const std::string& metadataFile,
                                               const ClassDirectoryRef& directory) {
    struct stat file;
    // The container's name within the class directory, when its URL is that of an entry.
    std::string_view relative;
    if (directory && metadataFile.starts_with(directory->prefix)) {
        relative = std::string_view(metadataFile).substr(directory->prefix.size());
        size_t slash = relative.find('/');
        std::string_view name = relative.substr(0, slash);
        if (name.empty() || name == "." || name == ".." || relative.substr(slash + 1) != STWMetadata::fileName)
            relative = {};
    }
    // The relative path ends the path string, so it is terminated.
    if (!relative.empty() && fstatat(directory->descriptor.get(), relative.data(), &file, AT_SYMLINK_NOFOLLOW) == 0 &&
        record.isRecordOfFile(file))
        return true;
    if (lstat(metadataFile.c_str(), &file) != 0 || !record.isRecordOfFile(file))
        return false;
    // Found by its path but not beneath the directory the cache holds: that one was replaced.
    if (!relative.empty())
        _reopenClassDirectory(record, directory);
    return true;
}

void STWContainerCache::_reopenClassDirectory(const STWMetadata& record, const ClassDirectoryRef& replaced) {
    fs::path path = fs::path(replaced->prefix).parent_path(); // without the separator the prefix ends in
    STWErrorRef error;
    STWFileDescriptor descriptor = STWFileManager::defaultManager()->openDirectoryAtURL(
        path, STWTrustedAncestorForClass(record.userIdentity(), record.containerClass()), &error);
    if (!descriptor) {
        STW_LOG_ERROR(STWLogCategory::Cache, "Cannot open the class directory %@ again: %@", path, error);
        return;
    }
    STW_LOG_NOTICE(STWLogCategory::Cache, "The class directory %@ was replaced; opened it again", path);
    auto reopened = std::make_shared<const ClassDirectory>(ClassDirectory{replaced->prefix, std::move(descriptor)});
    STWLockGuard guard(_cacheLock);
    for (auto* caches : {&_liveContainerCache, &_transientContainerCache})
        for (auto& [key, cache] : *caches)
            if (cache.directory == replaced)
                cache.directory = reopened;
}

STWMetadataRef STWContainerCache::containerForContainerIdentity(const STWContainerIdentityRef& identity, bool transient,
                                                                bool updateSandbox, STWErrorRef* error) {
    return STW_CACHE_GUARDED(error, STWMetadataRef(), [&] {
        return _containerForContainerIdentity(identity, transient, updateSandbox, error);
    });
}

STWMetadataRef STWContainerCache::_containerForContainerIdentity(const STWContainerIdentityRef& identity,
                                                                 bool transient, bool updateSandbox,
                                                                 STWErrorRef* error) {
    if (!identity) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid input: identity: %@", nullptr));
        return nullptr;
    }
    _assertNotOnCodeSigningMappingQueue();
    const STWUserIdentityRef& userIdentity = identity->userIdentity();
    STWContainerClass contentClass = identity->containerClass();
    // Only messages name the class cache: the name is made when one is written.
    auto cacheName = [&] { return classCacheKey(userIdentity, contentClass); };

    STWMetadataRef record;
    ClassDirectoryRef directory;
    {
        STWLockGuard guard(_cacheLock);
        STWErrorRef underlying;
        ClassCache* cache = _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, updateSandbox,
                                                          &underlying);
        if (!cache) {
            STWSetError(error, STW_ERROR(STWErrorCacheRebuildFailed, underlying, "Cache: [%@]-%@%@: Failed to rebuild",
                                         userIdentity->identifier(), STWContainerClassDirectoryName(contentClass),
                                         transientMarker(transient)));
            return nullptr;
        }
        auto it = cache->records.find(identity->identifier());
        if (it == cache->records.end()) {
            STWSetError(error, STW_ERROR_NOLOG(STWErrorNotFound, nullptr, "Cache: %@%@: Container Not Found with ID: %@",
                                               cacheName(), transientMarker(transient), identity->identifier()));
            return nullptr;
        }
        record = it->second;
        directory = cache->directory;
    }

    record = _validatedRecord(record, directory, transient, error);
    if (record)
        STW_LOG_DEBUG(STWLogCategory::Cache, "Cache: %@%@: Found Identifier: %@", cacheName(), transientMarker(transient),
                      identity->identifier());
    return record;
}

STWMetadataRef STWContainerCache::containerForContainerIdentity(const STWConcreteContainerIdentityRef& identity) {
    if (!identity)
        return nullptr;
    // Errors of the two look-ups only say that this container is not there.
    STWMetadataRef live = containerForContainerIdentity(identity, false, true, nullptr);
    if (live && live->uuid() == identity->uuid())
        return live;
    STWMetadataRef transient = containerForContainerIdentity(identity, true, true, nullptr);
    if (transient && transient->uuid() == identity->uuid())
        return transient;
    return nullptr;
}

std::optional<std::vector<STWMetadataRef>> STWContainerCache::allContainersForUserIdentity(
    const STWUserIdentityRef& userIdentity, STWContainerClass contentClass, bool transient, STWErrorRef* error) {
    return allContainersForUserIdentity(userIdentity, contentClass, transient, true, error);
}

std::optional<std::vector<STWMetadataRef>> STWContainerCache::allContainersForUserIdentity(
    const STWUserIdentityRef& userIdentity, STWContainerClass contentClass, bool transient, bool populateSandboxCache,
    STWErrorRef* error) {
    return STW_CACHE_GUARDED(error, std::optional<std::vector<STWMetadataRef>>(), [&] {
        return _allContainersForUserIdentity(userIdentity, contentClass, transient, populateSandboxCache, error);
    });
}

std::optional<std::vector<STWMetadataRef>> STWContainerCache::_allContainersForUserIdentity(
    const STWUserIdentityRef& userIdentity, STWContainerClass contentClass, bool transient, bool populateSandboxCache,
    STWErrorRef* error) {
    if (!STWContainerClassIsValid(contentClass)) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                                     static_cast<long>(contentClass)));
        return std::nullopt;
    }
    if (!userIdentity) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid input: user identity: %@", nullptr));
        return std::nullopt;
    }
    _assertNotOnCodeSigningMappingQueue();

    std::vector<STWMetadataRef> records;
    // Each class cache's directory, after the index of its last record plus one.
    std::vector<std::pair<size_t, ClassDirectoryRef>> directories;
    {
        STWLockGuard guard(_cacheLock);
        std::vector<ClassCache*> caches;
        std::unordered_set<ClassCache*> seen;
        STWErrorRef failure;
        // Identities that share a key (the personal and the unspecific one, or every
        // identity for a global class) share a class cache, which counts once.
        auto collect = [&](const STWUserIdentityRef& identity) {
            if (failure)
                return;
            _cacheLock.assertHeld(__func__);
            STWErrorRef underlying;
            ClassCache* cache = _lock_getCacheForUserIdentity(identity, contentClass, transient, populateSandboxCache,
                                                              &underlying);
            if (!cache) {
                failure = STW_ERROR(STWErrorCacheRebuildFailed, underlying, "Cache: [%@]-%@%@: Failed to rebuild",
                                    identity->identifier(), STWContainerClassDirectoryName(contentClass),
                                    transientMarker(transient));
                return;
            }
            if (seen.insert(cache).second)
                caches.push_back(cache);
        };
        if (userIdentity->isNoSpecificPersona())
            _userIdentityCache->forEachAccessibleUserIdentitySynchronouslyExecuteBlock(collect);
        else
            collect(userIdentity);
        if (failure) {
            STWSetError(error, failure);
            return std::nullopt;
        }
        size_t total = 0;
        for (ClassCache* cache : caches)
            total += cache->records.size();
        records.reserve(total);
        directories.reserve(caches.size());
        for (ClassCache* cache : caches) {
            for (const auto& [identifier, record] : cache->records)
                records.push_back(record);
            directories.emplace_back(records.size(), cache->directory);
        }
    }

    // Stale records are logged and dropped, never reported: the caller asked for what exists.
    std::vector<STWMetadataRef> existing;
    existing.reserve(records.size());
    auto directory = directories.begin();
    for (size_t i = 0; i < records.size(); i++) {
        while (i >= directory->first)
            ++directory;
        const STWMetadataRef& record = records[i];
        if (_validatedRecord(record, directory->second, transient, nullptr))
            existing.push_back(record);
    }
    return existing;
}

// MARK: - Add and remove

bool STWContainerCache::addContainerMetadata(const STWMetadataRef& metadata, const fs::path& url, bool transient,
                                             bool updateSandbox, STWErrorRef* error) {
    return STW_CACHE_GUARDED(error, false,
                             [&] { return _addContainerMetadata(metadata, url, transient, updateSandbox, error); });
}

bool STWContainerCache::_addContainerMetadata(const STWMetadataRef& metadata, const fs::path& url, bool transient,
                                              bool updateSandbox, STWErrorRef* error) {
    STWContainerClass contentClass = metadata ? metadata->containerClass() : STWContainerClassUndefined;
    if (!STWContainerClassIsValid(contentClass)) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid Metadata Content Class: %lld",
                                     static_cast<long long>(contentClass)));
        return false;
    }
    if (url.empty() || !url.is_absolute()) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid input: URL: %@",
                                     url.empty() ? nullptr : url.c_str()));
        return false;
    }
    _assertNotOnCodeSigningMappingQueue();

    const STWUserIdentityRef& userIdentity = metadata->userIdentity();
    const std::string& identifier = metadata->identifier();
    std::string cacheName = classCacheKey(userIdentity, contentClass);
    bool shouldRegister = false;
    {
        STWLockGuard guard(_cacheLock);
        STWErrorRef underlying;
        ClassCache* cache = _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, true, &underlying);
        if (!cache) {
            STWSetError(error, STW_ERROR(STWErrorCacheRebuildFailed, underlying, "Cache: [%@]-%@%@: Failed to rebuild",
                                         userIdentity ? userIdentity->identifier() : std::string("(null)"),
                                         STWContainerClassDirectoryName(contentClass), transientMarker(transient)));
            return false;
        }
        STWMetadataRef record = metadata;
        if (metadata->url() != url || metadata->transient() != transient) {
            auto copy = std::make_shared<STWMetadata>(*metadata);
            copy->setUrl(url);
            copy->setTransient(transient);
            record = std::move(copy);
        }
        _storeRecord(*cache, std::move(record));
        if (updateSandbox)
            shouldRegister = _lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, contentClass);
    }

    if (updateSandbox && !transient && shouldRegister &&
        !_setSandboxContainerMappingForUserIdentity(userIdentity, identifier, contentClass, url))
        STW_LOG_ERROR(STWLogCategory::Cache, "Failed to set container mapping of %@, %llu", identifier, contentClass);
    STW_LOG_DEBUG(STWLogCategory::Cache, "Cache: %@%@: Added Identifier: %@", cacheName, transientMarker(transient),
                  identifier);
    return true;
}

bool STWContainerCache::removeContainerForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                       STWContainerClass contentClass, const std::string& identifier,
                                                       bool transient, STWErrorRef* error) {
    return STW_CACHE_GUARDED(error, false, [&] {
        return _removeContainerForUserIdentity(userIdentity, contentClass, identifier, transient, nullptr, error);
    });
}

bool STWContainerCache::_removeContainerForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                        STWContainerClass contentClass, const std::string& identifier,
                                                        bool transient, const STWMetadataRef& onlyRecord,
                                                        STWErrorRef* error) {
    if (!STWContainerClassIsValid(contentClass)) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid Content Class: %ld",
                                     static_cast<long>(contentClass)));
        return false;
    }
    if (!userIdentity) {
        STWSetError(error, STW_ERROR(STWErrorCacheInvalidInput, nullptr, "Invalid input: user identity: %@", nullptr));
        return false;
    }
    _assertNotOnCodeSigningMappingQueue();

    std::string cacheName = classCacheKey(userIdentity, contentClass);
    bool shouldRegister;
    bool superseded = false;
    {
        STWLockGuard guard(_cacheLock);
        STWErrorRef underlying;
        ClassCache* cache = _lock_getCacheForUserIdentity(userIdentity, contentClass, transient, true, &underlying);
        if (!cache) {
            STWSetError(error, STW_ERROR(STWErrorCacheRebuildFailed, underlying, "Cache: [%@]-%@%@: Failed to rebuild",
                                         userIdentity->identifier(), STWContainerClassDirectoryName(contentClass),
                                         transientMarker(transient)));
            return false;
        }
        auto it = cache->records.find(identifier);
        if (it != cache->records.end()) {
            // A stale record that was replaced meanwhile (a new container under the same
            // identifier) stays, and so does its mapping.
            if (onlyRecord && it->second != onlyRecord)
                superseded = true;
            else
                cache->records.erase(it);
        }
        shouldRegister = _lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, contentClass);
    }

    if (shouldRegister && !transient && !superseded &&
        !_setSandboxContainerMappingForUserIdentity(userIdentity, identifier, contentClass, std::nullopt))
        STW_LOG_ERROR(STWLogCategory::Cache, "Failed to remove container mapping of %@, %llu", identifier, contentClass);
    STW_LOG_DEBUG(STWLogCategory::Cache, "Cache: %@%@: Removed Identifier: %@", cacheName, transientMarker(transient),
                  identifier);
    return true;
}

// MARK: - Sandbox mappings

bool STWContainerCache::shouldRegisterSandboxMappingWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                     const std::string& identifier,
                                                                     STWContainerClass containerClass) {
    return STW_CACHE_GUARDED(nullptr, false, [&] {
        STWLockGuard guard(_cacheLock);
        return _lock_shouldRegisterSandboxMappingWithUserIdentity(userIdentity, identifier, containerClass);
    });
}

bool STWContainerCache::_lock_shouldRegisterSandboxMappingWithUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                           const std::string& identifier,
                                                                           STWContainerClass containerClass) {
    _cacheLock.assertHeld(__func__);
    if (!userIdentity)
        return false;
    bool shouldRegister;
    bool isMulti = false;
    std::string bundleIdentifier = identifier;
    if (STWContainerClassRegistersOnlyForEntitledUsers(containerClass)) {
        if (STWContainerClassIsChildData(containerClass))
            if (auto parent = _parentIdentifierForChildIdentifier(identifier))
                bundleIdentifier = *parent;
        STWUserIdentitySet owners = _userIdentityCache->userIdentitiesForBundleIdentifier(bundleIdentifier);
        // A bundle shared by the personal persona and others lives in the common sandbox:
        // every identity but an enterprise one maps it. Otherwise only its owners do.
        isMulti = owners.size() >= 2 && owners.count(_userIdentityCache->userIdentityForPersonalPersona()) > 0;
        shouldRegister = isMulti ? !userIdentity->isEnterprise() : owners.count(userIdentity) > 0;
    } else if (containerClass == STWContainerClassSharedAppGroup) {
        shouldRegister = true;
    } else {
        shouldRegister = !userIdentity->isEnterprise();
    }
    STW_LOG_INFO(STWLogCategory::Sandbox,
                 "Deciding to register userIdentity: %@, identifier: %@ (%@), containerClass: %llu with sandbox: %d "
                 "because isMulti: %d",
                 userIdentity, identifier, bundleIdentifier, containerClass, static_cast<int>(shouldRegister),
                 static_cast<int>(isMulti));
    return shouldRegister;
}

bool STWContainerCache::setSandboxContainerMappingForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                  const std::string& identifier,
                                                                  STWContainerClass containerClass,
                                                                  const std::optional<fs::path>& url) {
    return STW_CACHE_GUARDED(nullptr, false, [&] {
        return _setSandboxContainerMappingForUserIdentity(userIdentity, identifier, containerClass, url);
    });
}

bool STWContainerCache::_setSandboxContainerMappingForUserIdentity(const STWUserIdentityRef& userIdentity,
                                                                   const std::string& identifier,
                                                                   STWContainerClass containerClass,
                                                                   const std::optional<fs::path>& url) {
    if (STWContainerClassIsBundle(containerClass))
        return true;
    if (!STWContainerClassSandboxItemType(containerClass)) {
        STW_LOG_ERROR(STWLogCategory::Sandbox, "Unsupported class for setting sandbox container mapping: %llu",
                      containerClass);
        return false;
    }
    if (!userIdentity) {
        STW_LOG_ERROR(STWLogCategory::Sandbox, "Invalid input: user identity: %@", nullptr);
        return false;
    }

    STWSandboxMappingItem item = *_sandboxMappingItem(userIdentity, identifier, containerClass);
    const char* path = url ? url->c_str() : nullptr;
    auto store = STWSandboxMappingStore::sharedInstance();
    // The store leaves its errors to be logged here, after the line that names the mapping.
    STWErrorRef storeError;
    if (!store->setUserStateItem(item, std::nullopt, &storeError)) {
        STW_LOG_ERROR(STWLogCategory::Sandbox,
                      "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, path: %s : %d",
                      item.uid, item.itemType, identifier, containerClass, path, storeError->posixCode());
        STW_LOG_ERROR(STWLogCategory::Sandbox, "%@", storeError);
        return false;
    }
    if (url && !store->setUserStateItem(item, *url, &storeError)) {
        STW_LOG_ERROR(STWLogCategory::Sandbox,
                      "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, path: %s : %d",
                      item.uid, item.itemType, identifier, containerClass, path, storeError->posixCode());
        STW_LOG_ERROR(STWLogCategory::Sandbox, "%@", storeError);
        return false;
    }
    // Debug, not notice: a rebuild pushes one mapping per container.
    STW_LOG_DEBUG(STWLogCategory::Sandbox,
                  "Pushed user: %u, itemType: %llu, identifier %s, class: %llu, persona id: %d, path: %s", item.uid,
                  item.itemType, identifier, containerClass, item.kernelPersonaID, path);
    return true;
}

std::optional<STWSandboxMappingItem> STWContainerCache::_sandboxMappingItem(const STWUserIdentityRef& userIdentity,
                                                                           const std::string& identifier,
                                                                           STWContainerClass containerClass) {
    std::optional<uint32_t> itemType = STWContainerClassSandboxItemType(containerClass);
    if (!itemType || !userIdentity || STWContainerClassIsBundle(containerClass))
        return std::nullopt;
    STWSandboxMappingItem item;
    // System containers belong to no user; their mappings live in the state of user 0.
    item.uid = STWContainerClassIsSystem(containerClass) ? 0 : userIdentity->posixUIDForContainerClass(containerClass);
    // Keyed by the kernel persona id, which an identity has at every start; one built
    // without persona data goes by its user id.
    item.kernelPersonaID = userIdentity->kernelPersonaID() ? userIdentity->kernelPersonaID() : userIdentity->posixUID();
    item.itemType = *itemType;
    item.identifier = identifier;
    return item;
}
