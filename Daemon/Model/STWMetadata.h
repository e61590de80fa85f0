// The record of one container, kept inside it as ".com.vorlane.stowly.metadata.plist".
// The file is the ground truth from which the container cache is rebuilt: a directory
// whose metadata file is missing or invalid is not a container. Files are written as
// binary property lists through the class's staging directory and renamed into place, so
// readers never see a partial file; reading validates every field.
#pragma once

#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "common/STWError.h"
#include "common/STWValue.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

class STWMetadata;
using STWMetadataRef = std::shared_ptr<const STWMetadata>;

class STWMetadata {
public:
    static constexpr const char* fileName = ".com.vorlane.stowly.metadata.plist";

    // Info keys the daemon itself keeps; every other info key belongs to the clients.
    // The data-protection class chosen for a data container (an integer).
    static constexpr const char* contentProtectionClassInfoKey = "com.vorlane.Setwright.ContentProtectionClass";
    // Legacy values that the code-signing mapping reads and rewrites.
    static constexpr const char* groupContainerIDsInfoKey = "com.vorlane.Setwright.GroupContainerIDs";
    static constexpr const char* cachedCodeSigningInfoInfoKey = "com.vorlane.Setwright.CachedCodeSigningInfo";

    STWMetadata(const STWConcreteContainerIdentityRef& containerIdentity, std::optional<STWValue::Dictionary> info,
                std::filesystem::path url, std::optional<std::string> userManagedAssetsDirName);

    bool transient() const { return _transient; }
    void setTransient(bool transient) { _transient = transient; }
    bool existed() const { return _existed; }
    void setExisted(bool existed) { _existed = existed; }
    STWContainerClass containerClass() const { return _containerClass; }
    const STWUserIdentityRef& userIdentity() const { return _userIdentity; }
    const std::string& identifier() const { return _identifier; }
    const STWUUID& uuid() const { return _uuid; }
    void setUuid(const STWUUID& uuid) { _uuid = uuid; }
    std::filesystem::path url() const { return std::filesystem::path(_url); }
    void setUrl(const std::filesystem::path& url) { _url = url.native(); }
    const std::optional<std::string>& userManagedAssetsDirName() const { return _userManagedAssetsDirName; }
    void setUserManagedAssetsDirName(std::optional<std::string> name) { _userManagedAssetsDirName = std::move(name); }
    const std::optional<STWValue::Dictionary>& info() const { return _info; }
    void setInfo(std::optional<STWValue::Dictionary> info) { _info = std::move(info); }

    STWConcreteContainerIdentityRef containerIdentity() const;
    std::string description() const;

    // The dictionary stored in the file.
    STWValue::Dictionary dictionaryRepresentation() const;
    bool writeMetadataToDiskWithError(STWErrorRef* error) const;
    bool writeMetadataToFileURL(const std::filesystem::path& fileURL, STWErrorRef* error) const;

    static std::shared_ptr<STWMetadata> readAndValidateMetadataAtUrl(const std::filesystem::path& containerURL,
                                                                     const STWUserIdentityRef& forUserIdentity,
                                                                     bool checkClassPath, STWErrorRef* error);
    static std::shared_ptr<STWMetadata> readAndValidateMetadataAtFileUrl(const std::filesystem::path& fileURL,
                                                                         const STWUserIdentityRef& forUserIdentity,
                                                                         bool checkClassPath, STWErrorRef* error);

private:
    // `container` is the directory that holds `fileURL`.
    static std::shared_ptr<STWMetadata> _readAndValidateMetadata(const std::filesystem::path& fileURL,
                                                                 const std::filesystem::path& container,
                                                                 const STWUserIdentityRef& forUserIdentity,
                                                                 bool checkClassPath, STWErrorRef* error);

    bool _transient = false;
    bool _existed = false;
    STWContainerClass _containerClass;
    STWUserIdentityRef _userIdentity;
    std::string _identifier;
    STWUUID _uuid;
    // Kept as plain text: a std::filesystem::path also holds a parsed copy of every
    // component, several hundred bytes per record, and the container cache keeps one
    // record per container on the device.
    std::string _url;
    std::optional<std::string> _userManagedAssetsDirName;
    std::optional<STWValue::Dictionary> _info;
};
