#include "Daemon/Model/STWMetadata.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWFileIO.h"
#include "common/STWLog.h"
#include "common/STWPropertyList.h"

#include <cstring>
#include <fcntl.h>
#include <unistd.h>

// The file layer recognises the file by this name, which it cannot take from here.
static_assert(std::string_view(STWMetadata::fileName) == STWContainerMetadataFileName);

namespace {

constexpr const char* kClassKey = "STWMetadataContentClass";
constexpr const char* kIdentifierKey = "STWMetadataIdentifier";
constexpr const char* kUUIDKey = "STWMetadataUUID";
constexpr const char* kVersionKey = "STWMetadataVersion";
constexpr const char* kUserIdentityKey = "STWMetadataUserIdentity";
constexpr const char* kInfoKey = "STWMetadataInfo";
constexpr const char* kAssetsDirKey = "STWMetadataUserManagedAssetsDirName";
constexpr const char* kPersonaKey = "STWMetadataPersona";

// A value found in a file as the messages show it: a string as its text, anything else as
// its description, an absent value as "(null)".
STWFormatArg describe(const STWValue* v) {
    if (!v)
        return STWFormatArg(nullptr);
    if (const std::string* text = v->string())
        return STWFormatArg(*text);
    return STWFormatArg(*v);
}

// The last component of `path`, which loses it (and the separators before it).
std::string_view popComponent(std::string_view& path) {
    while (!path.empty() && path.back() == '/')
        path.remove_suffix(1);
    size_t slash = path.rfind('/');
    std::string_view last = slash == std::string_view::npos ? path : path.substr(slash + 1);
    path = slash == std::string_view::npos ? std::string_view() : path.substr(0, slash);
    return last;
}

// Whether the directory that holds `container` is the class directory of `containerClass`:
// the container's path minus its last three components, plus the class directory name
// (which always has two components). Compared as the two components that precede the
// container's own name, so the check reads the path text without building new paths;
// it runs for every container the cache finds.
bool isInClassDirectory(std::string_view container, STWContainerClass containerClass) {
    std::string_view name = STWContainerClassDirectoryName(containerClass);
    size_t slash = name.find('/');
    if (slash == std::string_view::npos)
        return false;
    popComponent(container);
    std::string_view kind = popComponent(container);
    std::string_view scope = popComponent(container);
    return !kind.empty() && scope == name.substr(0, slash) && kind == name.substr(slash + 1);
}

// Whom the metadata files the daemon writes belong to (root, in production).
uid_t daemonUser() {
    static const uid_t user = geteuid();
    return user;
}

} // namespace

STWMetadata::STWMetadata(const STWConcreteContainerIdentityRef& containerIdentity,
                         std::optional<STWValue::Dictionary> info, const std::filesystem::path& url,
                         std::optional<std::string> userManagedAssetsDirName)
    : _containerClass(containerIdentity->containerClass()), _userIdentity(containerIdentity->userIdentity()),
      _identifier(containerIdentity->identifier()), _uuid(containerIdentity->uuid()), _url(url.native()),
      _userManagedAssetsDirName(std::move(userManagedAssetsDirName)), _info(std::move(info)) {}

STWConcreteContainerIdentityRef STWMetadata::containerIdentity() const {
    return STWConcreteContainerIdentity::containerIdentityWithUUID(_uuid, _userIdentity, _identifier, _containerClass,
                                                                   nullptr);
}

std::string STWMetadata::description() const {
    return STWFormat("<%@: %p; userIdentity = %@, uuid = %@, containerClass = %llu, identifier = %@, info = %@, url = "
                     "%@, userManagedAssetsDirName = %@>",
                     "STWMetadata", static_cast<const void*>(this), _userIdentity, _uuid, _containerClass, _identifier,
                     _info ? STWFormatArg(STWDescribeDictionary(*_info)) : STWFormatArg(nullptr), _url,
                     _userManagedAssetsDirName ? STWFormatArg(*_userManagedAssetsDirName) : STWFormatArg(nullptr));
}

STWValue::Dictionary STWMetadata::dictionaryRepresentation() const {
    STWValue::Dictionary d;
    if (_info)
        d[kInfoKey] = STWValue(*_info);
    d[kClassKey] = STWValue(_containerClass);
    if (STWUserIdentity::isUserIdentityRequiredForContainerClass(_containerClass))
        d[kUserIdentityKey] = STWValue(_userIdentity->plist());
    d[kIdentifierKey] = STWValue(_identifier);
    d[kUUIDKey] = STWValue(_uuid.string());
    d[kVersionKey] = STWValue("2");
    if (_userManagedAssetsDirName)
        d[kAssetsDirKey] = STWValue(*_userManagedAssetsDirName);
    return d;
}

void STWMetadata::setFileIdentity(const struct stat& file) {
    _fileDevice = file.st_dev;
    _fileInode = file.st_ino;
}

bool STWMetadata::isRecordOfFile(const struct stat& file) const {
    return _fileInode != 0 && file.st_dev == _fileDevice && file.st_ino == _fileInode;
}

STWFileDescriptor STWMetadata::openContainerDirectory(STWErrorRef* error, STWFileDescriptor* classDirectoryOut) const {
    auto fileManager = STWFileManager::defaultManager();
    std::filesystem::path container = url();
    STWFileDescriptor classDirectory = fileManager->openDirectoryAtURL(
        container.parent_path(), STWTrustedAncestorForClass(_userIdentity, _containerClass), error);
    if (!classDirectory)
        return {};
    STWFileDescriptor fd = fileManager->openBeneath(classDirectory.get(), container.filename(), O_RDONLY | O_DIRECTORY,
                                                    0, STWOpenBeneathNoSymlinks, error);
    if (!fd)
        return {};
    struct stat file;
    if (fstatat(fd.get(), fileName, &file, AT_SYMLINK_NOFOLLOW) != 0 || !isRecordOfFile(file)) {
        STWSetError(error, STW_POSIX_ERROR(ESTALE, "%@ no longer holds the metadata of %@", container, _identifier));
        return {};
    }
    if (classDirectoryOut)
        *classDirectoryOut = std::move(classDirectory);
    return fd;
}

bool STWMetadata::moveContainerDirectory(const std::filesystem::path& to, unsigned options, STWErrorRef* error,
                                         STWFileDescriptor* movedParent, STWFileDescriptor* movedDirectory) const {
    auto fileManager = STWFileManager::defaultManager();
    STWFileDescriptor fromParent;
    STWFileDescriptor directory = openContainerDirectory(error, &fromParent);
    if (!directory)
        return false;
    STWFileDescriptor toParent = fileManager->openDirectoryAtURL(
        to.parent_path(), STWTrustedAncestorForClass(_userIdentity, _containerClass), error);
    if (!toParent || !fileManager->moveDirectoryAt(fromParent.get(), url().filename(), toParent.get(), to.filename(),
                                                   directory.get(), static_cast<STWFileManagerMoveOptions>(options),
                                                   url(), to, error))
        return false;
    if (movedParent)
        *movedParent = std::move(toParent);
    if (movedDirectory)
        *movedDirectory = std::move(directory);
    return true;
}

bool STWMetadata::writeMetadataToDiskWithError(STWErrorRef* error) {
    if (_fileInode == 0)
        return writeMetadataToFileURL(url() / fileName, error);
    STWFileDescriptor container = openContainerDirectory(error);
    return container && writeMetadataToContainerDirectory(container.get(), error);
}

bool STWMetadata::writeMetadataToFileURL(const std::filesystem::path& fileURL, STWErrorRef* error) {
    STWFileDescriptor directory = STWFileManager::defaultManager()->openDirectoryAtURL(fileURL.parent_path(), error);
    return directory && _writeMetadataAt(directory.get(), fileURL.filename(), fileURL, error);
}

bool STWMetadata::writeMetadataToContainerDirectory(int containerfd, STWErrorRef* error) {
    return _writeMetadataAt(containerfd, fileName, url() / fileName, error);
}

bool STWMetadata::_writeMetadataAt(int dirfd, const std::string& name, const std::filesystem::path& fileURL,
                                   STWErrorRef* error) {
    STWValue::Dictionary dictionary = dictionaryRepresentation();
    STW_LOG_DEBUG(STWLogCategory::Metadata, "[%s] Writing metadata to [%@]: %@ => %@", __func__, fileURL, *this,
                  STWValue(dictionary));
    auto fileManager = STWFileManager::defaultManager();
    STWErrorRef stepError;
    // Written beside its final name, through the directory's descriptor: a path through a
    // directory the app owns could lead anywhere by the time it is used.
    auto temp = fileManager->writeTemporaryFileAt(dirfd, STWPropertyList::serializeBinary(STWValue(dictionary)), 0644,
                                                  fileURL.parent_path(), &stepError);
    if (!temp) {
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, stepError,
                                     "Failed to write metadata dictionary to URL %@ : %@:%ld", fileURL,
                                     stepError->domain(), stepError->code()));
        return false;
    }
    struct stat written;
    if (!fileManager->replaceFileAt(dirfd, *temp, name, true, &written, fileURL, &stepError)) {
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, stepError,
                                     "Failed to move metadata from staging: %@ to final: %@",
                                     fileURL.parent_path() / temp->name, fileURL));
        return false;
    }
    setFileIdentity(written);
    return true;
}

std::shared_ptr<STWMetadata> STWMetadata::readAndValidateMetadataAtUrl(const std::filesystem::path& containerURL,
                                                                       const STWUserIdentityRef& forUserIdentity,
                                                                       bool checkClassPath, STWErrorRef* error) {
    // A trailing separator names the same container; the record's url must not keep it.
    std::filesystem::path container = containerURL.has_filename() ? containerURL : containerURL.parent_path();
    return readAndValidateMetadataAtFileUrl(container / fileName, forUserIdentity, checkClassPath, error);
}

std::shared_ptr<STWMetadata> STWMetadata::readAndValidateMetadataAtFileUrl(const std::filesystem::path& fileURL,
                                                                           const STWUserIdentityRef& forUserIdentity,
                                                                           bool checkClassPath, STWErrorRef* error) {
    std::filesystem::path container = fileURL.parent_path();
    std::filesystem::path classDirectory = container.parent_path();
    STWFileDescriptor classfd(open(classDirectory.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    if (!classfd) {
        STWSetError(error, STW_ERROR(STWErrorReadFileFailed, nullptr, "Failed to read metadata at URL %@", fileURL));
        return nullptr;
    }
    return _readAndValidateMetadata(classfd.get(), (container.filename() / fileURL.filename()).native(),
                                    fileURL.native(), container, forUserIdentity, checkClassPath, error);
}

std::shared_ptr<STWMetadata> STWMetadata::readAndValidateMetadataInDirectory(int classfd, const std::string& name,
                                                                             const std::filesystem::path& containerURL,
                                                                             const STWUserIdentityRef& forUserIdentity,
                                                                             bool checkClassPath, STWErrorRef* error) {
    return _readAndValidateMetadata(classfd, name + "/" + fileName, containerURL.native() + "/" + fileName,
                                    containerURL, forUserIdentity, checkClassPath, error);
}

std::shared_ptr<STWMetadata> STWMetadata::_readAndValidateMetadata(int dirfd, const std::string& relativePath,
                                                                   const std::string& fileURL,
                                                                   const std::filesystem::path& container,
                                                                   const STWUserIdentityRef& forUserIdentity,
                                                                   bool checkClassPath, STWErrorRef* error) {
    // The container and the file are the app's to replace: no link is followed on the way,
    // and nothing but a regular file of the daemon's own is read. O_NONBLOCK keeps a FIFO
    // from hanging the open.
    STWErrorRef openError;
    STWFileDescriptor fd = STWFileManager::defaultManager()->openBeneath(
        dirfd, relativePath, O_RDONLY | O_NONBLOCK | O_NOCTTY, 0, STWOpenBeneathNoSymlinks, &openError);
    struct stat st;
    std::string bytes;
    std::optional<STWValue> root;
    const char* problem = nullptr;
    int e = 0;
    if (!fd)
        problem = "cannot be opened";
    else if (fstat(fd.get(), &st) != 0)
        e = errno;
    else if (!S_ISREG(st.st_mode))
        problem = "is not a regular file";
    else if (static_cast<uint64_t>(st.st_size) > maximumFileSize)
        problem = "is larger than 1 MiB";
    else if (st.st_uid != daemonUser()) {
        // Anyone can copy another container's (readable) metadata into a directory of
        // theirs; only what the daemon wrote makes a directory a container.
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr,
                                     "Metadata at %@ is owned by uid %u, not written by stowlyd: not a container",
                                     fileURL, st.st_uid));
        return nullptr;
    } else if (!(e = STWReadDescriptorContents(fd.get(), static_cast<size_t>(st.st_size), &bytes, maximumFileSize))) {
        root = STWPropertyList::parse(bytes);
        if (!root || !root->isDictionary())
            problem = "is not a property-list dictionary";
    }
    if (e || problem) {
        STWErrorRef reason = openError ? openError
                                       : STW_POSIX_ERROR_NOLOG(e ? e : EINVAL, "%@ %s", fileURL,
                                                               e ? strerror(e) : problem);
        STWSetError(error, STW_ERROR(STWErrorReadFileFailed, reason, "Failed to read metadata at URL %@", fileURL));
        return nullptr;
    }
    STWValue::Dictionary& plist = *root->mutableDictionary();

    const STWValue* identifierValue = STWDictionaryFind(plist, kIdentifierKey);
    if (!identifierValue || !identifierValue->string()) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata Identifier: %@ at %@",
                                     describe(identifierValue), fileURL));
        return nullptr;
    }
    const std::string& identifier = *identifierValue->string();

    const STWValue* uuidValue = STWDictionaryFind(plist, kUUIDKey);
    if (!uuidValue || !uuidValue->string()) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata UUID String: %@ at %@",
                                     describe(uuidValue), fileURL));
        return nullptr;
    }
    std::optional<STWUUID> uuid = STWUUID::fromString(*uuidValue->string());
    if (!uuid) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata UUID: %@ at %@", describe(uuidValue),
                                     fileURL));
        return nullptr;
    }

    const STWValue* classValue = STWDictionaryFind(plist, kClassKey);
    if (!classValue || !classValue->isNumber()) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata Class: %@ at %@",
                                     describe(classValue), fileURL));
        return nullptr;
    }
    int64_t classNumber = classValue->truncatedInt64Value().value_or(0);
    if (classNumber < 1 || classNumber > 13) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata Content Class: %ld at %@",
                                     classNumber, fileURL));
        return nullptr;
    }
    STWContainerClass containerClass = static_cast<STWContainerClass>(classNumber);

    auto cache = STWUserIdentitySharedCache::sharedInstance();
    STWUserIdentityRef userIdentity;
    if (!STWUserIdentity::isUserIdentityRequiredForContainerClass(containerClass)) {
        userIdentity = STWUserIdentityCache::defaultUserIdentity();
    } else {
        // Without an expected identity no owner can match (and no stored identity either).
        uid_t expectedOwner = forUserIdentity ? forUserIdentity->posixUIDForContainerClass(containerClass) : 0;
        if (STWContainerClassIsPerUser(containerClass)) {
            const STWValue* persona = STWDictionaryFind(plist, kPersonaKey);
            if (!persona) {
                plist[kPersonaKey] = STWValue(expectedOwner);
            } else if (persona->uint64Value() != static_cast<uint64_t>(expectedOwner)) {
                STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Incorrect UserId: %@, expecting: %u for %@ at %@",
                                             describe(persona), expectedOwner, identifier, fileURL));
                return nullptr;
            }
        }
        const STWValue* stored = STWDictionaryFind(plist, kUserIdentityKey);
        if (!stored) {
            std::optional<uint64_t> persona = STWDictionaryUInt64(plist, kPersonaKey);
            uid_t uid = persona && *persona <= UINT32_MAX ? static_cast<uid_t>(*persona) : 0;
            userIdentity = cache->userIdentityForPersonalPersonaWithUID(uid, uid);
        } else {
            uint64_t code = STWErrorSuccess;
            userIdentity = STWUserIdentity::userIdentityWithPlist(*stored, *cache, &code);
            if (!userIdentity) {
                STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr,
                                             "Invalid metadata User Identity: %@ for %@ at %@: %llu", *stored, identifier,
                                             fileURL, code));
                return nullptr;
            }
            if (!forUserIdentity || !(*userIdentity == *forUserIdentity)) {
                STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr,
                                             "Incorrect User Identity: %@, expecting: %@ for %@ at %@: %llu", userIdentity,
                                             forUserIdentity, identifier, fileURL, code));
                return nullptr;
            }
        }
    }

    std::optional<STWValue::Dictionary> info;
    if (const STWValue* infoValue = STWDictionaryFind(plist, kInfoKey)) {
        if (!infoValue->dictionary()) {
            STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata Info: %@ at %@", describe(infoValue),
                                         fileURL));
            return nullptr;
        }
        info = *infoValue->dictionary();
    }
    std::optional<std::string> assetsDirName;
    if (const STWValue* assets = STWDictionaryFind(plist, kAssetsDirKey)) {
        if (!assets->string()) {
            STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr,
                                         "Invalid metadata User Managed Dir Name String: %@ at %@", describe(assets), fileURL));
            return nullptr;
        }
        assetsDirName = *assets->string();
    }

    if (checkClassPath && !isInClassDirectory(container.native(), containerClass)) {
        std::filesystem::path expected = container.parent_path().parent_path().parent_path() /
                                         STWContainerClassDirectoryName(containerClass);
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Invalid metadata-URLs should match: %@ : %@",
                                     fileURL, expected));
        return nullptr;
    }

    uint64_t identityCode = STWErrorSuccess;
    auto identity = STWConcreteContainerIdentity::containerIdentityWithUUID(*uuid, userIdentity, identifier,
                                                                            containerClass, &identityCode);
    if (!identity) {
        STWSetError(error, STW_ERROR(STWErrorInvalidContent, nullptr, "Could not create user identity from %@: %llu",
                                     fileURL, identityCode));
        return nullptr;
    }
    auto metadata = std::make_shared<STWMetadata>(identity, std::move(info), container, std::move(assetsDirName));
    metadata->setFileIdentity(st);
    STW_LOG_DEBUG(STWLogCategory::Metadata, "[%s] Read metadata from [%@]: %@ <= %@", __func__, fileURL, *metadata,
                  STWValue(plist));
    return metadata;
}
