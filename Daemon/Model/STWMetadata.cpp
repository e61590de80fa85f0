#include "Daemon/Model/STWMetadata.h"

#include "Daemon/FileSystem/STWFileManager.h"
#include "Daemon/Model/STWGlobalConfiguration.h"
#include "Daemon/Model/STWUserIdentitySharedCache.h"
#include "common/STWDictionaryUtilities.h"
#include "common/STWLog.h"

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

} // namespace

STWMetadata::STWMetadata(const STWConcreteContainerIdentityRef& containerIdentity,
                         std::optional<STWValue::Dictionary> info, std::filesystem::path url,
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

bool STWMetadata::writeMetadataToDiskWithError(STWErrorRef* error) const {
    return writeMetadataToFileURL(url() / fileName, error);
}

bool STWMetadata::writeMetadataToFileURL(const std::filesystem::path& fileURL, STWErrorRef* error) const {
    STWValue::Dictionary dictionary = dictionaryRepresentation();
    std::filesystem::path temp =
        STWGlobalConfiguration::sharedInstance()->stagingDirectoryURLForUserIdentity(_userIdentity, _containerClass) /
        STWFormat("temp_metadata-%@.plist", _uuid.string());
    STW_LOG_DEBUG(STWLogCategory::Metadata, "[%s] Writing metadata to [%@]: %@ => %@", __func__, fileURL, *this,
                  STWValue(dictionary));
    STWErrorRef writeError;
    // Not synced here: the durable move below syncs the file before the rename makes it
    // visible, and the directory after it; syncing twice would only double the cost.
    if (!STW_writeToURL(dictionary, temp, STWWriteNoFileProtection, &writeError)) {
        // A half-written temporary file must not stay behind in staging.
        std::error_code ignored;
        std::filesystem::remove(temp, ignored);
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, writeError,
                                     "Failed to write metadata dictionary to URL %@ : %@:%ld", temp,
                                     writeError->domain(), writeError->code()));
        return false;
    }
    STWErrorRef moveError;
    if (!STWFileManager::defaultManager()->moveItemAtURL(temp, fileURL, STWFileManagerMoveDurable, &moveError)) {
        std::error_code ignored;
        std::filesystem::remove(temp, ignored);
        STWSetError(error, STW_ERROR(STWErrorWriteFileFailed, moveError,
                                     "Failed to move metadata from staging: %@ to final: %@", temp, fileURL));
        return false;
    }
    return true;
}

std::shared_ptr<STWMetadata> STWMetadata::readAndValidateMetadataAtUrl(const std::filesystem::path& containerURL,
                                                                       const STWUserIdentityRef& forUserIdentity,
                                                                       bool checkClassPath, STWErrorRef* error) {
    // The container cache reads every container this way; the directory is at hand, so it
    // is not derived again from the file's path (unless it was given with a trailing
    // separator, which the record's url must not keep).
    if (!containerURL.has_filename())
        return readAndValidateMetadataAtFileUrl(containerURL / fileName, forUserIdentity, checkClassPath, error);
    return _readAndValidateMetadata(containerURL / fileName, containerURL, forUserIdentity, checkClassPath, error);
}

std::shared_ptr<STWMetadata> STWMetadata::readAndValidateMetadataAtFileUrl(const std::filesystem::path& fileURL,
                                                                           const STWUserIdentityRef& forUserIdentity,
                                                                           bool checkClassPath, STWErrorRef* error) {
    return _readAndValidateMetadata(fileURL, fileURL.parent_path(), forUserIdentity, checkClassPath, error);
}

std::shared_ptr<STWMetadata> STWMetadata::_readAndValidateMetadata(const std::filesystem::path& fileURL,
                                                                   const std::filesystem::path& container,
                                                                   const STWUserIdentityRef& forUserIdentity,
                                                                   bool checkClassPath, STWErrorRef* error) {
    // The container's owner may replace the file; never follow a link it put there.
    auto read = STW_dictionaryWithContentsOfURL(fileURL, STWReadNoFollow, nullptr);
    if (!read) {
        STWSetError(error, STW_ERROR(STWErrorReadFileFailed, nullptr, "Failed to read metadata at URL %@", fileURL));
        return nullptr;
    }
    STWValue::Dictionary& plist = *read;

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
    int64_t classNumber = classValue->int64Value().value_or(static_cast<int64_t>(classValue->realValue().value_or(0)));
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
    STW_LOG_DEBUG(STWLogCategory::Metadata, "[%s] Read metadata from [%@]: %@ <= %@", __func__, fileURL, *metadata,
                  STWValue(plist));
    return metadata;
}
