// One change of a data container's protection class: the directories and files of the
// container's user data get the new class, persisted first as an update file so that a
// change cut short by a stop, or waiting for the device to unlock, is finished by the next
// start (STWDataProtectionManager::restartPendingDataProtectionOperationsWithError).
//
// The update file is PendingUpdates/"IDENTIFIER-CLASS-USER.plist", one per container; a
// newer change of the same container replaces it, and its internal change ID tells an older
// operation that it has been superseded. The file has no protection class of its own, so it
// can be read while the device is locked.
//
// The walk runs below a directory that the application owns and may change under it: every
// item is opened from its parent's descriptor without following links, links, FIFOs and
// other special files are skipped, and classes are set through the descriptors opened.
//
// Threads: update-file reads, writes and deletes run on `queue` (the manager's file queue);
// the `_onQueue_` forms assert it. The change itself runs on the caller's thread under the
// container's per-identifier read lock; a rerun after an unlock runs on the lock-state
// queue. An operation is driven by one thread at a time (its first run, then each rerun).
#pragma once

#include "Daemon/Model/STWContainerIdentity.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"
#include "common/STWValue.h"
#include "platform/STWQueue.h"

#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>

// Bits of a change type.
enum STWDataProtectionChangeType : int32_t {
    STWDataProtectionChangeDirectories = 1,
    STWDataProtectionChangeFiles = 2,
    // Files only ever move to a stronger class (a lower class number).
    STWDataProtectionChangeOnlyStronger = 4,
};

class STWDataProtectionChangeOperation : public std::enable_shared_from_this<STWDataProtectionChangeOperation> {
public:
    using RetryStartBlock = std::function<void()>;
    using CompletionBlock = std::function<void(bool wasLocked, const STWErrorRef& error)>;

    // The contents of an update file, checked; `userIdentity` is nullptr for a class that
    // needs none.
    struct UpdateInfo {
        std::string identifier;
        STWContainerClass containerClass = 0;
        STWUserIdentityRef userIdentity;
        int32_t protectionClass = 0;
        uint32_t changeType = 0;
        bool retryIfLocked = false;
        STWUUID internalChangeID;
    };

    static std::shared_ptr<STWDataProtectionChangeOperation>
    dataProtectionChangeOperationWithContainerMetadata(STWMetadataRef metadata, int32_t settingClass,
                                                       bool retryingIfLocked, int32_t changeType,
                                                       std::shared_ptr<STWQueue> queue);
    // No `internalChangeID`: a fresh random one.
    STWDataProtectionChangeOperation(STWMetadataRef metadata, int32_t newClass, bool retryingIfLocked,
                                     int32_t changeType, std::optional<STWUUID> internalChangeID,
                                     std::shared_ptr<STWQueue> queue,
                                     std::shared_ptr<STWUserIdentityCache> userIdentityCache);
    // The operation stored in an update file, for its container as it is now, with the
    // file's change ID so that it is the most current update of that file.
    static std::shared_ptr<STWDataProtectionChangeOperation>
    dataProtectionChangeOperationAtURL(const std::filesystem::path& url, std::shared_ptr<STWQueue> queue,
                                       STWErrorRef* error);
    // Reads an update file back: 38 no URL, 12 unreadable or not a dictionary, 29 a key
    // missing or mistyped (checked in a fixed order, so the first bad key is the one named).
    static std::optional<UpdateInfo> _readAndValidateDataProtectionUpdateAtURL(const std::filesystem::path& url,
                                                                               STWUserIdentityCache& userIdentityCache,
                                                                               STWErrorRef* error);

    static std::filesystem::path urlForProtectionOperationWithContainerIdentity(const STWContainerIdentity& identity);
    // Removes the container's update file; a missing one is no error.
    static bool deleteUpdateFileWithContainerIdentity(const STWContainerIdentity& identity, STWErrorRef* error);

    // Synchronous on `queue`.
    bool writeToDiskWithError(STWErrorRef* error);
    bool _deleteUpdateFileWithError(STWErrorRef* error);
    bool _stillMostCurrentUpdate();
    bool _onQueue_writeToDiskWithError(STWErrorRef* error);
    bool _onQueue_deleteUpdateFileWithError(STWErrorRef* error);
    bool _onQueue_stillMostCurrentUpdate();

    // Runs the change. Locked with retrying allowed: parks a rerun on the lock-state queue
    // and returns; the update file stays and the completion waits. Otherwise the class is
    // recorded (on success), the update file goes, and the completion runs.
    void performChangeOperation();
    // The walk. Success with `needToRetry` set when the device was locked.
    bool _runChangeOperationNeedToRetry(bool* needToRetry, STWErrorRef* error);

    bool retryIfLocked() const { return _retryIfLocked; }
    bool retried() const { return _retried; }
    int32_t newDataProtectionClass() const { return _newDataProtectionClass; }
    int32_t changeType() const { return _changeType; }
    const STWMetadataRef& dataContainerMetadata() const { return _dataContainerMetadata; }
    const STWUUID& internalChangeID() const { return _internalChangeID; }
    const std::shared_ptr<STWQueue>& queue() const { return _queue; }
    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }
    void setRetryStartBlock(RetryStartBlock block) { _retryStartBlock = std::move(block); }
    void setCompletionBlock(CompletionBlock block) { _completionBlock = std::move(block); }
    // Run once the change has been applied and before the update file goes: records the new
    // class, so that a stop in between leaves the file for the next start to finish.
    void setRecordClassBlock(std::function<void()> block) { _recordClassBlock = std::move(block); }

    std::string description() const;

private:
    std::string _describeOwner() const;

    bool _retryIfLocked;
    bool _retried = false;
    int32_t _newDataProtectionClass;
    int32_t _changeType;
    STWMetadataRef _dataContainerMetadata;
    RetryStartBlock _retryStartBlock;
    CompletionBlock _completionBlock;
    std::function<void()> _recordClassBlock;
    STWUUID _internalChangeID;
    std::shared_ptr<STWQueue> _queue;
    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
};
