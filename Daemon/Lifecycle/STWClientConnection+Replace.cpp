// Replace: a new container (usually a transient one an installer or a wipe prepared) takes
// the place of an existing one of the same class and user identity. The old directory is
// parked in staging, the new one moved to the destination; a journal naming all four
// paths is written first, so that a start after a crash can put the old one back.
#include "Daemon/Request/STWClientConnection.h"

#include "Daemon/CodeSigning/STWCodeSigningMapping.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Lifecycle/STWContainerCache.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/STWLocks.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWException.h"
#include "common/STWFileIO.h"
#include "common/STWFormat.h"
#include "common/STWLog.h"
#include "platform/STWCrashPoint.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fcntl.h>

namespace {

constexpr const char* kOldURLKey = "STWReplaceOperationOldURL";
constexpr const char* kNewURLKey = "STWReplaceOperationNewURL";
constexpr const char* kStagingURLKey = "STWReplaceOperationStagingURL";
constexpr const char* kDestURLKey = "STWReplaceOperationDestURL";

// A path from a journal: absolute and without "..", else nothing.
std::optional<std::filesystem::path> directoryURLFromString(const STWValue* value) {
    const std::string* text = value ? value->string() : nullptr;
    if (!text || text->empty() || text->front() != '/' || text->find('\0') != std::string::npos ||
        containsDotDotPathComponents(*text))
        return std::nullopt;
    return std::filesystem::path(*text);
}

STWFormatArg pathOrNil(const std::filesystem::path& path) {
    return path.empty() ? STWFormatArg(nullptr) : STWFormatArg(path);
}

} // namespace

bool STWClientConnection::replaceContainerIdentity(const STWConcreteContainerIdentityRef& oldIdentity,
                                                   const STWConcreteContainerIdentityRef& newIdentity,
                                                   bool preserveOldUUID, bool startDeletionThread, uint64_t* error) {
    if (!newIdentity || !STWContainerClassIsValid(newIdentity->containerClass())) {
        STW_ERROR(STWErrorInvalidClass, nullptr, "Can't act on an invalid object: newUUID: %@, Class: %ld",
                  newIdentity ? STWFormatArg(newIdentity->uuid()) : STWFormatArg(nullptr),
                  newIdentity ? newIdentity->containerClass() : 0);
        *error = STWErrorInvalidClass;
        return false;
    }
    if (oldIdentity) {
        if (oldIdentity->containerClass() != newIdentity->containerClass()) {
            STW_ERROR(STWErrorReplaceAcrossClasses, nullptr, "Can't replace containers of different class types: %ld and %ld",
                      oldIdentity->containerClass(), newIdentity->containerClass());
            *error = STWErrorReplaceAcrossClasses;
            return false;
        }
        if (!(*oldIdentity->userIdentity() == *newIdentity->userIdentity())) {
            STW_ERROR(STWErrorPersonaMismatch, nullptr, "Can't replace containers of different personas: %@ and %@",
                      oldIdentity->userIdentity(), newIdentity->userIdentity());
            *error = STWErrorPersonaMismatch;
            return false;
        }
    } else if (preserveOldUUID) {
        STW_ERROR(STWErrorInvalidClass, nullptr, "Can't have a nil oldContainerUUID when preserving the UUID");
        *error = STWErrorInvalidClass;
        return false;
    }

    STWAllIdentifiersLockGuard lock(STWLockMode::Writing);
    auto cache = STWContainerCache::sharedInstance();
    auto configuration = STWGlobalConfiguration::sharedInstance();
    uint64_t code = STWErrorSuccess;
    STWMetadataRef oldRecord;
    // Kept outside the body: the exception path puts the old container back from staging,
    // and the clean-up sends staging and journal to death row whatever happened.
    std::filesystem::path destination, staging, replaceFile;
    // The old container in staging, while it is there: the directory it is in and itself.
    struct {
        STWFileDescriptor parent, directory;
    } parked;
    auto fail = [&](uint64_t failure) {
        code = failure;
        return false;
    };
    auto body = [&]() -> bool {
        if (oldIdentity && !(oldRecord = cache->containerForContainerIdentity(oldIdentity))) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", oldIdentity);
            return fail(STWErrorNotFound);
        }
        STWMetadataRef newRecord = cache->containerForContainerIdentity(newIdentity);
        if (!newRecord) {
            STW_ERROR(STWErrorNotFound, nullptr, "No Container with identity: %@", newIdentity);
            return fail(STWErrorNotFound);
        }
        if (oldRecord && newRecord->url() == oldRecord->url()) {
            STW_ERROR(STWErrorReplaceWithSelf, nullptr, "Can't replace the same container at %@", newRecord->url());
            return fail(STWErrorReplaceWithSelf);
        }
        std::optional<STWUUID> newUUID = STWUUID::fromString(newRecord->url().filename().native());
        if (!newUUID) {
            STW_ERROR(STWErrorInvalidPath, nullptr, "Invalid URL (last path component not UUID): %@", newRecord->url());
            return fail(STWErrorInvalidPath);
        }
        bool transient = oldRecord && oldRecord->transient();
        auto fileManager = STWFileManager::defaultManager();
        if (preserveOldUUID) {
            destination = oldRecord->url();
        } else {
            auto classDirectory = configuration->containerDirectoryURLForUserIdentity(
                newRecord->userIdentity(), newRecord->containerClass(), transient);
            destination = (classDirectory ? *classDirectory : std::filesystem::path()) / newUUID->string();
            if (!classDirectory || fileManager->itemExistsAtURL(destination)) {
                STW_ERROR(STWErrorAlreadyExists, nullptr, "Container already exists at %@", destination);
                return fail(STWErrorAlreadyExists);
            }
        }

        if (!oldRecord) {
            STWErrorRef lookupError;
            if (cache->containerForContainerIdentity(newIdentity, false, true, &lookupError)) {
                STW_ERROR(STWErrorAlreadyExists, nullptr,
                          "Container with identifier: %@, class: %ld, transient: %d already exists",
                          newIdentity->identifier(), newIdentity->containerClass(), 0);
                return fail(STWErrorAlreadyExists);
            }
            if (!lookupError || !lookupError->is(STWErrorNotFound))
                return fail(_codeOfError(lookupError));
        } else {
            std::string name = STWUUID::random().string();
            replaceFile = configuration->replaceDirectory() / (name + ".plist");
            staging = configuration->stagingDirectoryURLForUserIdentity(newRecord->userIdentity(),
                                                                        newRecord->containerClass()) /
                      name;
            STWErrorRef stepError;
            if (!_writeToDiskReplaceAt(replaceFile, {oldRecord->url(), newRecord->url(), staging, destination},
                                       &stepError)) {
                STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to write replace file: %@", replaceFile);
                replaceFile.clear(); // nothing has moved, and there is no journal to send away
                return fail(_codeOfError(stepError));
            }
            STW_CRASH_POINT(STWCrashPoint::replaceAfterJournal);
            if (!oldRecord->moveContainerDirectory(staging, STWFileManagerMoveSyncDirectories, &stepError,
                                                   &parked.parent, &parked.directory)) {
                STW_ERROR(STWErrorMoveToStagingFailed, stepError, "Failed to move old %@ to staging %@",
                          oldRecord->url(), staging);
                return fail(STWErrorMoveToStagingFailed);
            }
            STW_CRASH_POINT(STWCrashPoint::replaceAfterPark);
            if (!cache->removeContainerForUserIdentity(oldRecord->userIdentity(), oldRecord->containerClass(),
                                                       oldRecord->identifier(), oldRecord->transient(), &stepError)) {
                STW_ERROR(STWErrorCacheRemoveFailed, stepError,
                          "Failed to remove from cache id: %@, class: %ld, transient: %d", oldRecord->identifier(),
                          oldRecord->containerClass(), oldRecord->transient() ? 1 : 0);
                return fail(STWErrorCacheRemoveFailed);
            }
            if (STWContainerClassIsBundle(oldRecord->containerClass()) &&
                !_invalidateCodeSigningInfoForIdentifierAndItsChildren(oldRecord->identifier(), &stepError)) {
                STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to invalidate code signing info for %@",
                              oldRecord->identifier());
                return fail(_codeOfError(stepError));
            }
        }

        auto replacement = std::make_shared<STWMetadata>(*newRecord);
        STWErrorRef stepError;
        bool rewritten = true;
        if (preserveOldUUID && replacement->uuid() != oldRecord->uuid()) {
            // The new content keeps the old UUID on disk as well, before it is in place: the
            // next start reads the container from its metadata file.
            replacement->setUuid(oldRecord->uuid());
            STWFileDescriptor directory = newRecord->openContainerDirectory(&stepError);
            rewritten = directory && replacement->writeMetadataToContainerDirectory(directory.get(), &stepError);
        }
        if (!rewritten ||
            !replacement->moveContainerDirectory(destination, STWFileManagerMoveSyncDirectories, &stepError)) {
            STW_ERROR(STWErrorReplaceFailed, stepError, "Failed to replace: %@ with: %@ at: %@",
                      oldRecord ? STWFormatArg(oldRecord->url()) : STWFormatArg(nullptr), newRecord->url(),
                      destination);
            return fail(STWErrorReplaceFailed);
        }
        STW_CRASH_POINT(STWCrashPoint::replaceAfterMove);
        if (!cache->removeContainerForUserIdentity(newRecord->userIdentity(), newRecord->containerClass(),
                                                   newRecord->identifier(), newRecord->transient(), &stepError)) {
            STW_ERROR(STWErrorCacheRemoveFailed, stepError, "Failed to remove from cache id: %@, class: %ld, transient: %d",
                      newRecord->identifier(), newRecord->containerClass(), newRecord->transient() ? 1 : 0);
            return fail(STWErrorCacheRemoveFailed);
        }
        replacement->setUrl(destination);
        replacement->setTransient(transient);
        if (!cache->addContainerMetadata(replacement, destination, transient, true, &stepError)) {
            STW_ERROR(STWErrorCacheAddFailed, stepError, "Failed to add to cache: %@, url: %@, transient: %d",
                      replacement, destination, transient ? 1 : 0);
            return fail(STWErrorCacheAddFailed);
        }
        STW_CRASH_POINT(STWCrashPoint::replaceBeforeCleanup);
        return true;
    };

    try {
        body();
    } catch (...) {
        STWErrorForCurrentException(__func__, __LINE__, STWExceptionReportForImage(configuration->isInternalImage()));
        code = STWErrorException;
        auto fileManager = STWFileManager::defaultManager();
        if (!destination.empty() && oldRecord && fileManager->itemDoesNotExistAtURL(oldRecord->url()) &&
            fileManager->itemDoesNotExistAtURL(destination)) {
            STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Recovering from exception by moving: %@ to %@", staging,
                          oldRecord->url());
            STWErrorRef moveError;
            if (!fileManager->moveItemAtURLWithoutForeignLinks(staging, oldRecord->url(), STWFileManagerMoveSyncDirectories,
                                                               &moveError)) {
                // The journal stays for the next start, which tries again.
                STW_ERROR(STWErrorBadReplaceFile, moveError, "Failed to recover replace move: %@ to %@", staging,
                          oldRecord->url());
                abort();
            }
            parked = {};
        }
    }

    if (!replaceFile.empty()) {
        STWErrorRef cleanupError;
        // Staging and journal share one directory in death row: their names differ (the
        // journal's has its extension). The batch is gone before the pass starts.
        auto batch = std::make_unique<DeathRowBatch>();
        // The parked container need not leave staging durably: should a power cut bring it
        // back there, it is garbage that no class directory lists. It is moved by the
        // descriptors the park left open; never parked (or put back since), there is nothing
        // to move.
        if (parked.directory &&
            !_moveItemAtToDeathRow(parked.parent.get(), staging.filename(), parked.directory.get(), staging,
                                   &cleanupError, STWFileManagerMoveDefault, batch.get())) {
            STW_ERROR(STWErrorRemovePendingFileFailed, cleanupError, "Failed to remove staging dir: %@", staging);
            code = STWErrorRemovePendingFileFailed;
        }
        // The journal lies in the daemon's own replace directory, root's below root's: it is
        // opened as its path says, with none of the checks a path of unknown owners needs.
        // A journal that is gone counts as moved, as for any move into death row.
        std::string name = replaceFile.filename();
        STWErrorRef journalError;
        STWFileDescriptor journalDirectory =
            STWFileManager::defaultManager()->openDirectoryAtURL(replaceFile.parent_path(), &journalError);
        STWFileDescriptor journal;
        if (journalDirectory) {
            journal.reset(openat(journalDirectory.get(), name.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
            if (int e = journal ? 0 : errno; e && e != ENOENT)
                journalError = STW_POSIX_ERROR(e, "Could not open %@ to move it to death row: %s", replaceFile,
                                               strerror(e));
        }
        bool removed = journal ? _moveItemAtToDeathRow(journalDirectory.get(), name, journal.get(), replaceFile,
                                                       &journalError, STWFileManagerMoveSyncSourceDirectory,
                                                       batch.get())
                               : !journalError;
        batch.reset();
        if (!removed) {
            STW_ERROR(STWErrorRemovePendingFileFailed, journalError, "Failed to remove replace file: %@", replaceFile);
            code = STWErrorRemovePendingFileFailed;
        } else if (journal && startDeletionThread) {
            deleteContainersOnDeathRowWithCompletion(nullptr);
        }
    }
    if (code != STWErrorSuccess) {
        *error = code;
        return false;
    }
    return true;
}

bool STWClientConnection::_writeToDiskReplaceAt(const std::filesystem::path& url, const ReplaceFileInfo& info,
                                                STWErrorRef* error) {
    if (info.oldURL.empty() || info.newURL.empty() || info.stagingURL.empty() || info.destURL.empty()) {
        STWSetError(error, STW_ERROR(STWErrorInvalidReplaceInfo, nullptr,
                                     "Invalid Replace File Info: old: %@, new: %@, staging: %@, dest: %@",
                                     pathOrNil(info.oldURL), pathOrNil(info.newURL), pathOrNil(info.stagingURL),
                                     pathOrNil(info.destURL)));
        return false;
    }
    STWValue::Dictionary dictionary;
    dictionary[kOldURLKey] = STWValue(info.oldURL.native());
    dictionary[kNewURLKey] = STWValue(info.newURL.native());
    dictionary[kStagingURLKey] = STWValue(info.stagingURL.native());
    dictionary[kDestURLKey] = STWValue(info.destURL.native());
    // Synced with its directory before the first rename it guards; readable before the
    // first unlock. Written in place under its fresh name: one cut short by a crash was cut
    // short before anything moved, and the next start, whether it can read it or not, only
    // removes it.
    // That spares the rename of a temporary file and the wait for it to reach the disk.
    STWErrorRef writeError;
    int e = 0;
    if (!STW_writeToURL(dictionary, url, STWWriteDurable | STWWriteNoFileProtection, &writeError) ||
        (e = STWSyncDirectory(url.parent_path())) != 0) {
        if (e)
            writeError = STW_POSIX_ERROR(e, "Could not sync the directory of %@: %s", url, strerror(e));
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, writeError, "Failed to write replace dictionary to URL %@",
                                     url));
        return false;
    }
    return true;
}

std::optional<STWClientConnection::ReplaceFileInfo>
STWClientConnection::_readAndValidateReplaceFileAtUrl(const std::filesystem::path& url, STWErrorRef* error) {
    STWErrorRef readError;
    auto dictionary = STW_dictionaryWithContentsOfURL(url, 0, &readError);
    if (!dictionary) {
        if (readError && readError->domain() == STWGenericErrorDomain) {
            STW_ERROR(STWErrorBadReplaceFile, readError, "Bad Data in replace file: %@", url);
            return std::nullopt;
        }
        STWSetError(error, STW_ERROR(STWErrorBadReplaceFile, readError, "Failed to read replace file at URL %@", url));
        return std::nullopt;
    }
    auto oldURL = directoryURLFromString(STWDictionaryFind(*dictionary, kOldURLKey));
    auto newURL = directoryURLFromString(STWDictionaryFind(*dictionary, kNewURLKey));
    auto stagingURL = directoryURLFromString(STWDictionaryFind(*dictionary, kStagingURLKey));
    auto destURL = directoryURLFromString(STWDictionaryFind(*dictionary, kDestURLKey));
    if (!oldURL || !newURL || !stagingURL || !destURL) {
        auto describe = [&](const char* key) {
            const STWValue* value = STWDictionaryFind(*dictionary, key);
            return value ? STWFormatArg(*value) : STWFormatArg(nullptr);
        };
        STWSetError(error, STW_ERROR(STWErrorBadReplaceFile, nullptr,
                                     "Invalid replace data: Old: %@, New: %@, Staging: %@, Dest: %@",
                                     describe(kOldURLKey), describe(kNewURLKey), describe(kStagingURLKey),
                                     describe(kDestURLKey)));
        return std::nullopt;
    }
    return ReplaceFileInfo{*oldURL, *newURL, *stagingURL, *destURL};
}

bool STWClientConnection::_recoverFromReplaceOperationsWithError(STWErrorRef* error) {
    auto fileManager = STWFileManager::defaultManager();
    std::filesystem::path directory = STWGlobalConfiguration::sharedInstance()->replaceDirectory();
    // A journal that an earlier version cut short while writing it through a temporary file
    // never named anything that moved; that file is hidden from the listing below and would
    // stay for good.
    if (int removed = STWRemoveAbandonedAtomicWrites(directory); removed > 0)
        STW_LOG_NOTICE(STWLogCategory::Lifecycle, "Removed %d unfinished replace journals in %@", removed, directory);
    STWErrorRef listError;
    auto files = fileManager->urlsForItemsInDirectoryAtURL(directory, &listError);
    if (!files) {
        if (!(listError && listError->isPOSIX(ENOENT)))
            STW_LOG_ERROR(STWLogCategory::Lifecycle, "Failed to get items at replace URL %@ : %@", directory, listError);
        return true;
    }
    for (const auto& file : *files) {
        STWErrorRef readError;
        if (auto info = _readAndValidateReplaceFileAtUrl(file, &readError)) {
            STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Doing a replace of %@ with info: %@", file,
                          STWFormat("old: %@, new: %@, staging: %@, dest: %@", info->oldURL, info->newURL,
                                    info->stagingURL, info->destURL));
            // The old container in place (the first rename never happened, or the new one
            // took its path), or the new one at its destination: nothing to undo. Nothing in
            // staging either: the replace finished but for removing this journal, and what
            // it moved has been deleted since; the journal only has to go.
            if (fileManager->itemDoesNotExistAtURL(info->oldURL) && fileManager->itemDoesNotExistAtURL(info->destURL) &&
                !fileManager->itemDoesNotExistAtURL(info->stagingURL)) {
                STW_LOG_DEBUG(STWLogCategory::Lifecycle, "Recovering from failed replace by moving: %@ to %@",
                              info->stagingURL, info->oldURL);
                STWErrorRef moveError;
                if (!fileManager->moveItemAtURLWithoutForeignLinks(info->stagingURL, info->oldURL,
                                                                   STWFileManagerMoveSyncDirectories, &moveError)) {
                    STWSetError(error, STW_ERROR(STWErrorBadReplaceFile, moveError,
                                                 "Failed to recover replace move: %@ to %@", info->stagingURL,
                                                 info->oldURL));
                    return false;
                }
            }
        }
        STWErrorRef moveError;
        if (!_moveItemAtURLToDeathRow(file, false, false, &moveError)) {
            STWSetError(error, STW_ERROR(STWErrorRemovePendingFileFailed, moveError,
                                         "Failed to remove replace file at %@", file));
            return false;
        }
    }
    return true;
}

bool STWClientConnection::_invalidateCodeSigningInfoForIdentifierAndItsChildren(const std::string& identifier,
                                                                                 STWErrorRef* error) {
    auto mapping = STWCodeSigningMapping::sharedInstance();
    if (!mapping) {
        STWSetError(error, STW_ERROR(STWErrorDatabase, nullptr, "No code-signing mapping to invalidate %@ in",
                                     identifier));
        return false;
    }
    return mapping->invalidateCodeSigningInfoForIdentifierAndItsChildren(identifier, error);
}
