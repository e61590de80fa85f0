// Deletion: a container leaves its class directory by one rename into death row (a
// stage-for-delete command run when the request completes), and the death-row queue
// empties death row later. A wipe replaces a data container with a fresh one of the same
// path and UUID.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWCommandStageForDelete.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWPlatformConfiguration.h"

#include <algorithm>
#include <fcntl.h>
#include <functional>
#include <mutex>
#include <set>
#include <sys/stat.h>

// Where items are moved into death row: a fresh "temp." directory there, open, whose name
// is in the filling set from its mkdir until the last item is in.
struct STWClientConnection::DeathRowBatch::Slot {
    std::shared_ptr<const STWGlobalConfiguration::OpenDirectory> deathRow;
    STWFileDescriptor fd;
    std::filesystem::path url;
    std::string name;
    ~Slot();
};

namespace {

using DeathRowSlot = STWClientConnection::DeathRowBatch::Slot;

// The "temp." directories that moves are filling: a deletion pass skips them. A name goes
// in under the mutex together with its mkdir, so a pass that listed the directory finds
// it here until the filling is over.
std::mutex fillingMutex;
std::set<std::string>& fillingNames() {
    static std::set<std::string> names;
    return names;
}

bool isBeingFilled(const std::string& name) {
    std::lock_guard lock(fillingMutex);
    return fillingNames().count(name) != 0;
}

// A fresh "temp." directory in death row's held descriptor, which the layout reopens once
// death row was removed, registered as being filled.
std::unique_ptr<DeathRowSlot> makeSlot(STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    auto deathRow = configuration->openDeathrowDirectory(error);
    if (!deathRow)
        return nullptr;
    std::lock_guard lock(fillingMutex);
    auto unique = fileManager->createTemporaryDirectoryAt(deathRow->fd.get(), "temp.", deathRow->url, error);
    if (!unique)
        return nullptr;
    fillingNames().insert(unique->name);
    auto slot = std::make_unique<DeathRowSlot>();
    slot->deathRow = deathRow;
    slot->fd = std::move(unique->fd);
    slot->url = deathRow->url / unique->name;
    slot->name = std::move(unique->name);
    return slot;
}

// Moves an item into death row with `move` (given the directory it goes into): the batch's
// directory when it has one, else a fresh one, which the batch keeps for its next items.
// A directory that went meanwhile (death row removed) makes the rename answer ENOENT;
// that means that, not a missing item (`isGone` tells), and the move is tried again in a
// new one. A name already in the batch's directory goes into a new one as well.
bool moveIntoDeathRow(const std::filesystem::path& url,
                      const std::function<bool(const DeathRowSlot& slot, STWErrorRef* error)>& move,
                      const std::function<bool()>& isGone, std::unique_ptr<DeathRowSlot>* kept, bool* moved,
                      STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    *moved = false;
    for (int attempt = 0;; ++attempt) {
        STWErrorRef stepError;
        std::unique_ptr<DeathRowSlot> fresh;
        DeathRowSlot* slot = kept ? kept->get() : nullptr;
        if (!slot) {
            fresh = makeSlot(&stepError);
            if (!fresh) {
                // Death row removed between the check of its descriptor and the new
                // directory: the next attempt reopens it.
                if (stepError && stepError->isPOSIX(ENOENT) && attempt < 8)
                    continue;
                STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError,
                                             "Failed to create unique directory at: %@",
                                             configuration->deathrowDirectory()));
                return false;
            }
            slot = fresh.get();
            STW_CRASH_POINT(STWCrashPoint::deathRowAfterTemporaryDirectory);
        }
        if (move(*slot, &stepError)) {
            *moved = true;
            if (fresh && kept)
                *kept = std::move(fresh);
            return true;
        }
        bool missing = stepError && stepError->isPOSIX(ENOENT);
        if (missing && isGone()) {
            // Nothing to move, and no pass is started for nothing: a fresh directory goes
            // now rather than stay in death row until some later pass.
            if (fresh)
                fileManager->removeItemAt(fresh->deathRow->fd.get(), fresh->name, fresh->url);
            return true;
        }
        if (!fresh && (missing || (stepError && stepError->isPOSIX(EEXIST)))) {
            kept->reset(); // the batch's directory went, or holds that name: a new one
            continue;
        }
        if (!missing || attempt == 8) {
            STWSetError(error, STW_ERROR(STWErrorItemOperationFailed, stepError, "Failed to move item at: %@ to: %@",
                                         url, slot->url / url.filename()));
            return false;
        }
    }
}

} // namespace

STWClientConnection::DeathRowBatch::Slot::~Slot() {
    std::lock_guard lock(fillingMutex);
    fillingNames().erase(name);
}

STWClientConnection::DeathRowBatch::DeathRowBatch() = default;
STWClientConnection::DeathRowBatch::~DeathRowBatch() = default;

bool STWClientConnection::_moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                                   bool startDeletionThread, STWErrorRef* error,
                                                   STWFileManagerMoveOptions options) {
    (void)isDir; // the move takes whatever is there, and checks that it took that
    auto fileManager = STWFileManager::defaultManager();
    bool moved = false;
    std::string name = url.filename();
    bool ok = moveIntoDeathRow(
        url,
        [&](const DeathRowSlot& unique, STWErrorRef* stepError) {
            // The item may sit in a directory an app owns: nothing on the way is followed.
            return fileManager->moveItemAtURLWithoutForeignLinks(url, unique.fd.get(), name, unique.url / name,
                                                                 options, stepError);
        },
        [&] { return fileManager->itemDoesNotExistAtURL(url); }, nullptr, &moved, error);
    if (ok && moved && startDeletionThread)
        deleteContainersOnDeathRowWithCompletion(nullptr);
    return ok;
}

bool STWClientConnection::_moveItemAtToDeathRow(int parentfd, const std::string& name, int itemfd,
                                                const std::filesystem::path& url, STWErrorRef* error,
                                                STWFileManagerMoveOptions options, DeathRowBatch* batch) {
    auto fileManager = STWFileManager::defaultManager();
    bool moved = false;
    return moveIntoDeathRow(
        url,
        [&](const DeathRowSlot& unique, STWErrorRef* stepError) {
            return fileManager->moveDirectoryAt(parentfd, name, unique.fd.get(), name, itemfd, options, url,
                                                unique.url / name, stepError);
        },
        [&] {
            struct stat st;
            return fstatat(parentfd, name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0 && errno == ENOENT;
        },
        batch ? &batch->_slot : nullptr, &moved, error);
}

bool STWClientConnection::_removeItemOrMoveToTempAtURL(const std::filesystem::path& url, STWErrorRef* error) {
    return _removeItemOrMoveToTempAt(AT_FDCWD, url, url, error);
}

bool STWClientConnection::_removeItemOrMoveToTempAt(int dirfd, const std::string& name,
                                                    const std::filesystem::path& url, STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef removeError;
    if (fileManager->removeItemAt(dirfd, name, url, &removeError) || (removeError && removeError->isPOSIX(ENOENT)))
        return true;
    STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
    std::filesystem::path temporary = STWPlatformConfiguration::sharedInstance()->resolve("/tmp");
    std::filesystem::path destination = temporary / url.filename();
    STWErrorRef moveError;
    // A private root prefix may have no temporary directory yet.
    if (fileManager->itemDoesNotExistAtURL(temporary))
        fileManager->createDirectoryAtURL(temporary, true, 01777, &moveError);
    if (!fileManager->moveItemAtURL(url, destination, &moveError)) {
        STWSetError(error, STW_ERROR(STWErrorMoveDirectoryFailed, moveError, "Failed to move dir: %@ to: %@", url,
                                     destination));
        return false;
    }
    return true;
}

void STWClientConnection::deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion) {
    // The queue holds a transaction for the pass until it ran, so idle exit waits for it.
    STWDaemonQueues::deathRow()->async([completion = std::move(completion)] {
        auto fileManager = STWFileManager::defaultManager();
        auto configuration = STWGlobalConfiguration::sharedInstance();
        uint64_t result = STWErrorSuccess;
        // Listed and emptied through its held descriptor: no item costs a look-up of the
        // whole path.
        STWErrorRef listError;
        auto open = configuration->openDeathrowDirectory(&listError);
        std::filesystem::path deathRow = open ? open->url : configuration->deathrowDirectory();
        auto items = open ? fileManager->itemsInDirectoryAt(open->fd.get(), deathRow, &listError) : std::nullopt;
        if (!items && !(listError && listError->isPOSIX(ENOENT))) {
            STW_ERROR(STWErrorDeleteFailed, listError, "Failed to get items for deletion: %@ : %@", deathRow,
                      listError);
            result = STWErrorDeleteFailed;
        }
        bool first = true;
        for (const auto& item : items ? *items : std::vector<STWFileManager::DirectoryItem>{}) {
            if (isBeingFilled(item.name))
                continue; // the pass started after the filling is over takes it
            STWErrorRef itemError;
            std::filesystem::path url = deathRow / item.name;
            if (!_removeItemOrMoveToTempAt(open->fd.get(), item.name, url, &itemError)) {
                STW_ERROR(STWErrorDestroyFailed, itemError, "Failed to destroy item at: %@", url);
                result = STWErrorDestroyFailed;
            }
            if (std::exchange(first, false))
                STW_CRASH_POINT(STWCrashPoint::deathRowAfterFirstItem);
        }
        if (completion)
            completion(result);
    });
}

bool STWClientConnection::deleteContainerWithContainerIdentity(const STWContainerIdentityRef& identity, bool transient,
                                                               uint64_t* error) {
    return _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        uint64_t lookupError = STWErrorSuccess;
        auto container = createOrLookupContainerWithContainerIdentity(identity, false, transient, true, &lookupError);
        if (!container) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle,
                          "Failed to lookup existing container to delete-identity: %@, transient: %d", identity,
                          transient ? 1 : 0);
            *error = lookupError;
            return false;
        }
        // The move happens when the request completes, after its own work.
        _commandQueue->insertCommand(STWCommandStageForDelete::commandForStageForDeleteWithContainerIdentities(
            {container->containerIdentity()}, true, nullptr));
        return true;
    });
}

void STWClientConnection::deleteDataContainerContentWithContainerIdentity(const STWContainerIdentityRef& identity,
                                                                          uint64_t* error) {
    _catchingExceptions<bool>(__func__, error, false, [&]() -> bool {
        const std::string& identifier = identity->identifier();
        STWContainerClass containerClass = identity->containerClass();
        if (!STWContainerClassIsPerUser(containerClass)) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle,
                          "Can't wipe container non-data container of type: %llu, identifier: %@", containerClass,
                          identifier);
            *error = STWErrorInvalidClass;
            return false;
        }
        if (!unrestricted()) {
            if (containerClass != STWContainerClassDataQuilletPlugin) {
                STW_LOG_ERROR(STWLogCategory::Lifecycle, "Can't wipe container with of type: %llu, identifier: %@",
                              containerClass, identifier);
                *error = STWErrorInvalidClass;
                return false;
            }
            auto entitled = entitledWipeIdentifiers();
            bool listed = entitled && std::any_of(entitled->begin(), entitled->end(), [&](const STWValue& value) {
                              return value.string() && *value.string() == identifier;
                          });
            if (!listed) {
                STW_LOG_ERROR(STWLogCategory::Lifecycle, "Not entitled to wipe container with identifier: %@",
                              identifier);
                *error = STWErrorNotEntitled;
                return false;
            }
        }
        setAllowOtherIdLookup(true);
        uint64_t code = STWErrorSuccess;
        auto existing = createOrLookupContainerWithContainerIdentity(identity, false, false, true, &code);
        if (!existing) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to lookup existing container to wipe-identifier: %@",
                          identifier);
            *error = code;
            return false;
        }
        auto fresh = createOrLookupContainerWithContainerIdentity(identity, true, true, true, &code);
        if (!fresh) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to create transient container for wipe-identifier: %@",
                          identifier);
            *error = code;
            return false;
        }
        if (!replaceContainerIdentity(existing->containerIdentity(), fresh->containerIdentity(), true, true, &code)) {
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed replace operation during delete all content");
            *error = code;
            return false;
        }
        return true;
    });
}
