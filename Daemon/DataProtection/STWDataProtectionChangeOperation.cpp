#include "Daemon/DataProtection/STWDataProtectionChangeOperation.h"

#include "Daemon/FileSystem/STWDirectoryWalker.h"
#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWDaemonQueues.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentity.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "Daemon/Request/STWClientConnection.h"
#include "Daemon/STWLocks.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"
#include "platform/STWSandboxMappingStore.h"

#include <cerrno>
#include <cstring>
#include <dirent.h>
#include <exception>
#include <fcntl.h>
#include <sys/stat.h>
#include <typeinfo>
#include <unistd.h>

namespace fs = std::filesystem;

namespace {

constexpr const char* kIdentifierKey = "STWDataOperationIdentifier";
constexpr const char* kContainerClassKey = "STWDataOperationContainerClass";
constexpr const char* kProtectionClassKey = "STWDataOperationProtectionClass";
constexpr const char* kChangeTypeKey = "STWDataOperationChangeType";
constexpr const char* kRetryIfLockedKey = "STWDataOperationRetryIfLocked";
constexpr const char* kInternalIDKey = "STWDataOperationInternalID";
constexpr const char* kUserIdentityKey = "STWDataOperationUserIdentity";
constexpr const char* kUserIdKey = "STWDataOperationUserId"; // read from older files only

STWFormatArg describe(const STWValue* value) { return value ? STWFormatArg(*value) : STWFormatArg(nullptr); }

// Sets the classes of one container's user data. Every item is opened from its parent's
// descriptor without following a link; what is not a directory or a regular file is left
// alone, and nothing on another file system is entered. A failure other than EBADF stops
// the walk (EPERM: the device is locked); everything else is logged and passed by.
class ProtectionWalk final : public STWDirectoryWalker::Delegate {
public:
    ProtectionWalk(int32_t protectionClass, int32_t changeType, const struct stat& container)
        : _class(protectionClass), _changeType(changeType), _device(container.st_dev) {}

    // One of the user-data items, opened beneath the container.
    void walkItem(int fd, const std::string& path) {
        struct stat st;
        if (fstat(fd, &st) != 0)
            return logError(path, errno);
        if (S_ISDIR(st.st_mode)) {
            if (st.st_dev != _device)
                return;
            _walker.walk(fd, path, *this);
            if (!_error)
                directory(fd, path);
        } else if (S_ISREG(st.st_mode)) {
            file(fd, st, path);
        }
    }

    bool visitEntry(int dirfd, const std::string& directoryPath, const STWDirectoryWalker::Entry& entry) override {
        if (_error)
            return false;
        if (entry.type == DT_DIR)
            return true;
        if (entry.type != DT_REG && entry.type != DT_UNKNOWN)
            return false; // links, FIFOs, sockets, devices
        if (entry.type == DT_REG && !(_changeType & STWDataProtectionChangeFiles))
            return false;
        // O_NONBLOCK: a FIFO swapped in since the entry was read opens without waiting for a
        // writer, and is then passed by as one.
        std::string path = directoryPath + "/" + entry.name;
        STWFileDescriptor fd(
            openat(dirfd, entry.name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY | O_CLOEXEC));
        if (!fd) {
            if (errno != ELOOP && errno != ENOENT && errno != ENXIO)
                logError(path, errno);
            return false;
        }
        struct stat st;
        if (fstat(fd.get(), &st) != 0) {
            logError(path, errno);
            return false;
        }
        if (S_ISDIR(st.st_mode))
            return true; // the walk opens it again, itself without following links
        if (S_ISREG(st.st_mode))
            file(fd.get(), st, path);
        return false;
    }

    bool enterDirectory(int, const std::string&, const std::string&, int fd) override {
        struct stat st;
        return !_error && fstat(fd, &st) == 0 && st.st_dev == _device;
    }

    void leaveDirectory(int, const std::string& directoryPath, const std::string& name, int fd) override {
        if (!_error)
            directory(fd, directoryPath + "/" + name);
    }

    void openFailed(int, const std::string& directoryPath, const std::string& name, int error) override {
        // A link or a file swapped in for the directory since it was listed is not walked.
        if (error != ELOOP && error != ENOTDIR && error != ENOENT)
            logError(directoryPath + "/" + name, error);
    }

    void readFailed(const std::string& path, int error) override { logError(path, error); }
    bool shouldStop() const override { return _error != nullptr; }

    STWErrorRef takeError() { return std::move(_error); }

private:
    void directory(int fd, const std::string& path) {
        if (!(_changeType & STWDataProtectionChangeDirectories))
            return;
        set(fd, path, _class, [&](int32_t current) {
            if (current == 2)
                return false;
            STW_LOG_DEBUG(STWLogCategory::FS, "Setting protection class of %s to %d", path, _class);
            return true;
        });
    }

    void file(int fd, const struct stat& st, const std::string& path) {
        if (!(_changeType & STWDataProtectionChangeFiles) || st.st_dev != _device)
            return;
        // A file with a second name may be linked in from outside the container (another
        // app's, of the same user); its class is not this container's to set.
        if (st.st_nlink > 1) {
            STW_LOG_NOTICE(STWLogCategory::FS, "Skipping file %s with %llu links", path,
                           static_cast<unsigned long long>(st.st_nlink));
            return;
        }
        int32_t target = _class == 0 ? 3 : _class;
        set(fd, path, target, [&](int32_t current) {
            if (current == 2 || current == target)
                return false;
            // A file that never had a class (0) has no protection to keep.
            if ((_changeType & STWDataProtectionChangeOnlyStronger) && current != 0 && target > current)
                return false;
            STW_LOG_DEBUG(STWLogCategory::FS, "Setting protection class of %s to %d", path, target);
            return true;
        });
    }

    void set(int fd, const std::string& path, int32_t target, const STWFileManager::ClassPredicate& predicate) {
        STWErrorRef error;
        if (STWFileManager::defaultManager()->setDataProtectionClassOfItemWithDescriptor(fd, path, target, predicate,
                                                                                        &error))
            return;
        if (error && error->isPOSIX(EBADF)) {
            struct stat st {};
            fstat(fd, &st);
            STW_LOG_ERROR(STWLogCategory::FS, "Ignoring failure to set protection class to %d on %@ (mode 0%o): %@",
                          target, path, static_cast<unsigned>(st.st_mode), error);
            return;
        }
        _error = std::move(error);
    }

    void logError(const std::string& path, int error) {
        STW_LOG_ERROR(STWLogCategory::FS, "FTS returned error for %s : %s", path, strerror(error));
    }

    const int32_t _class;
    const int32_t _changeType;
    const dev_t _device;
    STWDirectoryWalker _walker;
    STWErrorRef _error;
};

} // namespace

std::shared_ptr<STWDataProtectionChangeOperation>
STWDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(STWMetadataRef metadata,
                                                                                     int32_t settingClass,
                                                                                     bool retryingIfLocked,
                                                                                     int32_t changeType,
                                                                                     std::shared_ptr<STWQueue> queue) {
    return std::make_shared<STWDataProtectionChangeOperation>(std::move(metadata), settingClass, retryingIfLocked,
                                                              changeType, std::nullopt, std::move(queue),
                                                              STWUserIdentitySharedCache::sharedInstance());
}

STWDataProtectionChangeOperation::STWDataProtectionChangeOperation(
    STWMetadataRef metadata, int32_t newClass, bool retryingIfLocked, int32_t changeType,
    std::optional<STWUUID> internalChangeID, std::shared_ptr<STWQueue> queue,
    std::shared_ptr<STWUserIdentityCache> userIdentityCache)
    : _retryIfLocked(retryingIfLocked), _newDataProtectionClass(newClass), _changeType(changeType),
      _dataContainerMetadata(std::move(metadata)), _internalChangeID(internalChangeID.value_or(STWUUID::random())),
      _queue(std::move(queue)), _userIdentityCache(std::move(userIdentityCache)) {}

std::string STWDataProtectionChangeOperation::_describeOwner() const {
    const auto& user = _dataContainerMetadata ? _dataContainerMetadata->userIdentity() : nullptr;
    return user ? user->description() : std::string("(null)");
}

std::string STWDataProtectionChangeOperation::description() const {
    return STWFormat("<STWDataProtectionChangeOperation id: %@, class: %llu, to: %d, type: %d, change: %@>",
                     _dataContainerMetadata ? _dataContainerMetadata->identifier() : std::string(),
                     _dataContainerMetadata ? _dataContainerMetadata->containerClass() : 0, _newDataProtectionClass,
                     _changeType, _internalChangeID.string());
}

fs::path STWDataProtectionChangeOperation::urlForProtectionOperationWithContainerIdentity(
    const STWContainerIdentity& identity) {
    // The identifier is the client's: escaped as the sandbox mapping store escapes it, so the
    // name never climbs out of the directory.
    const auto& user = identity.userIdentity();
    std::string name = STWFormat("%@-%llu-%@.plist", STWSandboxMappingStore::nameForIdentifier(identity.identifier()),
                                 identity.containerClass(), user ? user->identifier() : std::string());
    return STWGlobalConfiguration::sharedInstance()->pendingUpdatesDirectory() / name;
}

bool STWDataProtectionChangeOperation::deleteUpdateFileWithContainerIdentity(const STWContainerIdentity& identity,
                                                                             STWErrorRef* error) {
    fs::path url = urlForProtectionOperationWithContainerIdentity(identity);
    STWErrorRef removeError;
    if (!STWFileManager::defaultManager()->removeItemAtURL(url, &removeError)) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to remove data protection file at %@ : %@", url, removeError);
        STWSetError(error, std::move(removeError));
        return false;
    }
    // The change is over only once its file is gone for good.
    STWFileDescriptor directory(open(url.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directory)
        fsync(directory.get());
    return true;
}

bool STWDataProtectionChangeOperation::writeToDiskWithError(STWErrorRef* error) {
    return _queue->syncResult([&] { return _onQueue_writeToDiskWithError(error); });
}

bool STWDataProtectionChangeOperation::_deleteUpdateFileWithError(STWErrorRef* error) {
    return _queue->syncResult([&] { return _onQueue_deleteUpdateFileWithError(error); });
}

bool STWDataProtectionChangeOperation::_stillMostCurrentUpdate() {
    return _queue->syncResult([&] { return _onQueue_stillMostCurrentUpdate(); });
}

bool STWDataProtectionChangeOperation::_onQueue_writeToDiskWithError(STWErrorRef* error) {
    _queue->assertCurrent(__func__);
    if (!_dataContainerMetadata || _changeType == 0) {
        STWSetError(error, STW_ERROR(STWErrorInvalidArgument, nullptr, "Invalid Update Info: metadata: %@, changeType: %u",
                                     _dataContainerMetadata ? _dataContainerMetadata->description() : "(null)",
                                     static_cast<uint32_t>(_changeType)));
        return false;
    }
    const STWMetadata& metadata = *_dataContainerMetadata;
    fs::path url = urlForProtectionOperationWithContainerIdentity(*metadata.containerIdentity());
    if (!STWFileManager::defaultManager()->removeItemAtURL(url, nullptr)) {
        STWSetError(error, STW_ERROR(STWErrorRemovePendingFileFailed, nullptr,
                                     "Failed to remove pending data protection file at %@", url));
        return false;
    }
    STWValue::Dictionary dictionary{
        {kIdentifierKey, STWValue(metadata.identifier())},
        {kContainerClassKey, STWValue(static_cast<uint64_t>(metadata.containerClass()))},
        {kProtectionClassKey, STWValue(_newDataProtectionClass)},
        {kChangeTypeKey, STWValue(static_cast<uint32_t>(_changeType))},
        {kRetryIfLockedKey, STWValue(_retryIfLocked)},
        {kInternalIDKey, STWValue(_internalChangeID.string())},
    };
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(metadata.containerClass()) && metadata.userIdentity())
        dictionary[kUserIdentityKey] = STWValue(metadata.userIdentity()->plist());
    // Synced with its directory before the walk it guards; no class of its own, so that it
    // can be read while the device is locked.
    STWErrorRef writeError;
    if (!STW_writeToURL(dictionary, url, STWWriteAtomic | STWWriteDurable | STWWriteNoFileProtection, &writeError)) {
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, writeError,
                                     "Failed to write data protection update dictionary to URL %@", url));
        return false;
    }
    return true;
}

bool STWDataProtectionChangeOperation::_onQueue_deleteUpdateFileWithError(STWErrorRef* error) {
    _queue->assertCurrent(__func__);
    if (!_onQueue_stillMostCurrentUpdate()) {
        STW_LOG_NOTICE(STWLogCategory::Lifecycle,
                       "Nothing to delete because there is a newer update for user: %@, id: %@, containerClass: %llu",
                       _describeOwner(), _dataContainerMetadata->identifier(), _dataContainerMetadata->containerClass());
        return true;
    }
    return deleteUpdateFileWithContainerIdentity(*_dataContainerMetadata->containerIdentity(), error);
}

bool STWDataProtectionChangeOperation::_onQueue_stillMostCurrentUpdate() {
    _queue->assertCurrent(__func__);
    fs::path url = urlForProtectionOperationWithContainerIdentity(*_dataContainerMetadata->containerIdentity());
    STWErrorRef error;
    auto info = _readAndValidateDataProtectionUpdateAtURL(url, *_userIdentityCache, &error);
    if (!info) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to read data protection update from %@", url);
        return false;
    }
    return info->internalChangeID == _internalChangeID;
}

std::optional<STWDataProtectionChangeOperation::UpdateInfo>
STWDataProtectionChangeOperation::_readAndValidateDataProtectionUpdateAtURL(const fs::path& url,
                                                                            STWUserIdentityCache& userIdentityCache,
                                                                            STWErrorRef* error) {
    if (url.empty()) {
        STWSetError(error, STW_ERROR(STWErrorInvalidArgument, nullptr, "URL cannot be nil"));
        return std::nullopt;
    }
    STWErrorRef readError;
    auto dictionary = STW_dictionaryWithContentsOfURL(url, 0, &readError);
    if (!dictionary) {
        STWSetError(error, STW_ERROR(STWErrorReadFileFailed, readError, "Failed to read update info at URL %@", url));
        return std::nullopt;
    }
    auto invalid = [&](STWErrorRef e) {
        STWSetError(error, std::move(e));
        return std::nullopt;
    };
    UpdateInfo info;
    const STWValue* identifier = STWDictionaryFind(*dictionary, kIdentifierKey);
    if (!identifier || !identifier->string())
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info Identifier: %@ at %@",
                                 describe(identifier), url));
    info.identifier = *identifier->string();

    const STWValue* containerClass = STWDictionaryFind(*dictionary, kContainerClassKey);
    auto classNumber = containerClass ? containerClass->truncatedInt64Value() : std::nullopt;
    if (!classNumber || *classNumber < 1 || *classNumber > 13)
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info container class: %ld at %@",
                                 classNumber.value_or(0), url));
    info.containerClass = static_cast<STWContainerClass>(*classNumber);

    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(info.containerClass)) {
        const STWValue* plist = STWDictionaryFind(*dictionary, kUserIdentityKey);
        const STWValue* uid = STWDictionaryFind(*dictionary, kUserIdKey);
        uint64_t code = STWErrorSuccess;
        if (plist && plist->isDictionary()) {
            info.userIdentity = STWUserIdentity::userIdentityWithPlist(*plist, userIdentityCache, &code);
        } else if (auto number = uid ? uid->uint64Value() : std::nullopt; number && *number <= UINT32_MAX) {
            auto id = static_cast<uid_t>(*number);
            info.userIdentity = userIdentityCache.userIdentityForPersonalPersonaWithUID(id, id);
        } else {
            return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info user id: %@ at %@",
                                     describe(uid), url));
        }
        if (!info.userIdentity)
            return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info user identity: %@ at %@: %llu",
                                     describe(plist ? plist : uid), url, code));
    }

    const STWValue* protectionClass = STWDictionaryFind(*dictionary, kProtectionClassKey);
    auto protection = protectionClass ? protectionClass->truncatedInt64Value() : std::nullopt;
    if (!protection || *protection < INT32_MIN || *protection > INT32_MAX)
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info protection class: %@ at %@",
                                 describe(protectionClass), url));
    info.protectionClass = static_cast<int32_t>(*protection);

    const STWValue* changeType = STWDictionaryFind(*dictionary, kChangeTypeKey);
    auto type = changeType ? changeType->truncatedInt64Value() : std::nullopt;
    if (!type || *type < 0 || *type > UINT32_MAX)
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info change type: %@ at %@",
                                 describe(changeType), url));
    info.changeType = static_cast<uint32_t>(*type);

    // A flag is a number to the file format: a boolean or an integer.
    const STWValue* retry = STWDictionaryFind(*dictionary, kRetryIfLockedKey);
    auto retryFlag = retry ? retry->boolValue() : std::nullopt;
    if (!retryFlag && retry && retry->truncatedInt64Value())
        retryFlag = *retry->truncatedInt64Value() != 0;
    if (!retryFlag)
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info retry: %@ at %@",
                                 describe(retry), url));
    info.retryIfLocked = *retryFlag;

    const STWValue* internalID = STWDictionaryFind(*dictionary, kInternalIDKey);
    if (!internalID || !internalID->string())
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info UUID String: %@ at %@",
                                 describe(internalID), url));
    auto uuid = STWUUID::fromString(*internalID->string());
    if (!uuid)
        return invalid(STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid update info UUID: %@ at %@",
                                 describe(internalID), url));
    info.internalChangeID = *uuid;
    return info;
}

std::shared_ptr<STWDataProtectionChangeOperation>
STWDataProtectionChangeOperation::dataProtectionChangeOperationAtURL(const fs::path& url,
                                                                     std::shared_ptr<STWQueue> queue,
                                                                     STWErrorRef* error) {
    auto cache = STWUserIdentitySharedCache::sharedInstance();
    STWErrorRef readError;
    auto info = _readAndValidateDataProtectionUpdateAtURL(url, *cache, &readError);
    if (!info) {
        STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to read data protection update at %@", url);
        STWSetError(error, std::move(readError));
        return nullptr;
    }
    STWUserIdentityRef user = info->userIdentity ? info->userIdentity : STWUserIdentityCache::defaultUserIdentity();
    uint64_t code = STWErrorSuccess;
    auto identity =
        STWContainerIdentity::containerIdentityWithUserIdentity(user, info->identifier, info->containerClass, &code);
    if (!identity) {
        STWSetError(error, STW_ERROR(code, nullptr, "Could not create user identity."));
        return nullptr;
    }
    code = STWErrorSuccess;
    auto metadata = STWClientConnection::privilegedClientConnectionWithUserIdentity(user)
                        ->createOrLookupContainerWithContainerIdentity(identity, false, false, true, &code);
    if (!metadata) {
        // The lookup's own code goes with it: only "not found" means the file is an orphan.
        STWSetError(error, STW_ERROR(STWErrorNotFound, STW_ERROR_NOLOG(code, nullptr, "Container lookup failed"),
                                     "Failed to lookup container metadata from file userId: %u, identifier: %@, "
                                     "Class: %llu : %llu",
                                     static_cast<unsigned>(user->posixUID()), info->identifier, info->containerClass,
                                     code));
        return nullptr;
    }
    return std::make_shared<STWDataProtectionChangeOperation>(
        std::move(metadata), info->protectionClass, info->retryIfLocked, static_cast<int32_t>(info->changeType),
        info->internalChangeID, std::move(queue), std::move(cache));
}

bool STWDataProtectionChangeOperation::_runChangeOperationNeedToRetry(bool* needToRetry, STWErrorRef* error) {
    *needToRetry = false;
    const STWMetadata& metadata = *_dataContainerMetadata;
    STWErrorRef walkError;
    try {
        STWIdentifierLockGuard guard(metadata.uuid().string(), STWLockMode::Reading);
        uint64_t code = STWErrorSuccess;
        auto identity = STWContainerIdentity::containerIdentityWithUserIdentity(
            metadata.userIdentity(), metadata.identifier(), metadata.containerClass(), &code);
        auto found = identity ? STWClientConnection::sharedClientConnection()->createOrLookupContainerWithContainerIdentity(
                                    identity, false, false, false, &code)
                              : nullptr;
        if (!found) {
            STWSetError(error, STW_ERROR(STWErrorNotFound, nullptr,
                                         "Failed to lookup container to set data protection for user identity: %@, "
                                         "identifier: %@, Class: %llu",
                                         _describeOwner(), metadata.identifier(), metadata.containerClass()));
            return false;
        }
        if (found->urlString() != metadata.urlString()) {
            STWSetError(error, STW_ERROR(STWErrorInvalidPath, nullptr,
                                         "Cancelling data protection operation because container path changed on "
                                         "disk. This indicates the app may have been updated and changed its "
                                         "protection level."));
            return false;
        }
        if (!_stillMostCurrentUpdate()) {
            STWSetError(error, STW_ERROR(STWErrorSuperseded, nullptr,
                                         "Cancelling data protection operation because another more current "
                                         "operation on this container has taken precedence"));
            return false;
        }
        STWFileDescriptor container = found->openContainerDirectory(&walkError);
        struct stat containerStat;
        if (container && fstat(container.get(), &containerStat) != 0)
            walkError = STW_POSIX_ERROR(errno, "Failed to stat container %@", found->url());
        if (container && !walkError) {
            ProtectionWalk walk(_newDataProtectionClass, _changeType, containerStat);
            auto fileManager = STWFileManager::defaultManager();
            for (const auto& name : STWGlobalConfiguration::appUserDataItemNames()) {
                // Only the item itself: a link in its place is passed by like any other link.
                STWErrorRef openError;
                STWFileDescriptor item =
                    fileManager->openBeneath(container.get(), name, O_RDONLY | O_NONBLOCK | O_NOCTTY | O_CLOEXEC, 0,
                                             STWOpenBeneathNoSymlinks, &openError);
                if (!item)
                    continue;
                walk.walkItem(item.get(), found->urlString() + "/" + name);
                if ((walkError = walk.takeError()))
                    break;
            }
        }
    } catch (const std::exception& e) {
        STWSetError(error, STW_ERROR(STWErrorException, nullptr, "Got exception: %@ : %@", typeid(e).name(), e.what()));
        return false;
    }
    if (walkError && walkError->isPOSIX(EPERM)) {
        *needToRetry = true;
        return true;
    }
    if (walkError) {
        STWSetError(error, std::move(walkError));
        return false;
    }
    return true;
}

void STWDataProtectionChangeOperation::performChangeOperation() {
    const STWMetadata& metadata = *_dataContainerMetadata;
    bool wasLocked = false;
    STWErrorRef error;
    if (!_runChangeOperationNeedToRetry(&wasLocked, &error)) {
        wasLocked = false;
        STW_LOG_NOTICE(STWLogCategory::Lifecycle,
                       "Operation to update protection classes for user: %@, id: %@, containerClass: %llu to class %d "
                       "failed with error %@",
                       _describeOwner(), metadata.identifier(), metadata.containerClass(), _newDataProtectionClass,
                       error);
    }
    if (wasLocked && _retryIfLocked) {
        STW_LOG_NOTICE(STWLogCategory::Lifecycle,
                       "Retrying container protection update to %d on next unlock for user: %@, id: %@, "
                       "containerClass: %llu",
                       _newDataProtectionClass, _describeOwner(), metadata.identifier(), metadata.containerClass());
        // The lock-state queue is suspended while the device is locked: the rerun waits for
        // the next unlock, holding an IPC transaction meanwhile.
        STWDaemonQueues::lockState()->async([self = shared_from_this()] {
            if (!self->_retried && self->_retryStartBlock)
                self->_retryStartBlock();
            self->_retried = true;
            self->performChangeOperation();
        });
        return;
    }
    if (wasLocked)
        error = STW_ERROR(STWErrorDeviceLocked, nullptr,
                          "Tried to update user: %@, id: %@, containerClass: %llu to protection class %d, but was "
                          "locked and didn't retry",
                          _describeOwner(), metadata.identifier(), metadata.containerClass(), _newDataProtectionClass);
    if (!error && _recordClassBlock) {
        STW_CRASH_POINT(STWCrashPoint::protectionAfterWalk);
        _recordClassBlock();
        STW_CRASH_POINT(STWCrashPoint::protectionAfterRecord);
    }
    STWErrorRef deleteError;
    if (!_deleteUpdateFileWithError(&deleteError))
        STW_LOG_ERROR(STWLogCategory::Lifecycle,
                      "Failed to delete update file for user: %@, id: %@, containerClass: %llu, protection class %d",
                      _describeOwner(), metadata.identifier(), metadata.containerClass(), _newDataProtectionClass);
    if (_completionBlock)
        _completionBlock(wasLocked, error);
}
