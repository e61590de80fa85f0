// The record of one container, kept inside it as ".com.vorlane.stowly.metadata.plist".
// The file is the ground truth from which the container cache is rebuilt: a directory
// whose metadata file is missing or invalid is not a container.
//
// The container belongs to its app, which may replace anything in it; so the file counts
// only when the daemon wrote it. It is written as root, mode 0644, beside its final name
// inside the container and renamed into place through the container's descriptor, then
// made immutable where the file system allows. A reader opens it beneath the class
// directory without following any link, checks before reading that it is a regular file
// of the daemon's own of at most 1 MiB (a FIFO, a device or a huge file is not read), and
// validates every field. The record keeps the file's device and inode, so a look-up can
// tell that the file it found is still the one it read.
#pragma once

#include "common/STWFileDescriptor.h"
#include "Daemon/Model/STWConcreteContainerIdentity.h"
#include "common/STWError.h"
#include "common/STWValue.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <sys/stat.h>

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
                const std::filesystem::path& url, std::optional<std::string> userManagedAssetsDirName);

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
    // The same path as text, for callers that would only take the text back out of url().
    const std::string& urlString() const { return _url; }
    void setUrl(const std::filesystem::path& url) { _url = url.native(); }
    const std::optional<std::string>& userManagedAssetsDirName() const { return _userManagedAssetsDirName; }
    void setUserManagedAssetsDirName(std::optional<std::string> name) { _userManagedAssetsDirName = std::move(name); }
    const std::optional<STWValue::Dictionary>& info() const { return _info; }
    void setInfo(std::optional<STWValue::Dictionary> info) { _info = std::move(info); }

    // The metadata file this record was read from or written to.
    void setFileIdentity(const struct stat& file);
    bool isRecordOfFile(const struct stat& file) const;

    STWConcreteContainerIdentityRef containerIdentity() const;
    std::string description() const;

    // The dictionary stored in the file.
    STWValue::Dictionary dictionaryRepresentation() const;
    // Writes the file into the container at url(); once the record knows its file, only
    // into the very directory that holds it.
    bool writeMetadataToDiskWithError(STWErrorRef* error);
    bool writeMetadataToFileURL(const std::filesystem::path& fileURL, STWErrorRef* error);
    // Writes the file into the container directory open as `containerfd`.
    bool writeMetadataToContainerDirectory(int containerfd, STWErrorRef* error);
    // The container directory that holds this record's file, opened beneath the class
    // directory without following links; ESTALE when the file there is not the one the
    // record was read from (the app replaced its container). `classDirectory`, when given,
    // gets the descriptor of the directory that holds it.
    STWFileDescriptor openContainerDirectory(STWErrorRef* error, STWFileDescriptor* classDirectory = nullptr) const;
    // Renames the container directory to `to`, never over an existing item: only the
    // directory that holds this record's own file, and nothing on the way followed.
    // `options` are STWFileManagerMoveOptions (the rename's durability). `movedParent` and
    // `movedDirectory`, when given, keep the new parent and the directory open, so that the
    // directory can be moved on without a look-up.
    bool moveContainerDirectory(const std::filesystem::path& to, unsigned options, STWErrorRef* error,
                                STWFileDescriptor* movedParent = nullptr,
                                STWFileDescriptor* movedDirectory = nullptr) const;

    static std::shared_ptr<STWMetadata> readAndValidateMetadataAtUrl(const std::filesystem::path& containerURL,
                                                                     const STWUserIdentityRef& forUserIdentity,
                                                                     bool checkClassPath, STWErrorRef* error);
    static std::shared_ptr<STWMetadata> readAndValidateMetadataAtFileUrl(const std::filesystem::path& fileURL,
                                                                         const STWUserIdentityRef& forUserIdentity,
                                                                         bool checkClassPath, STWErrorRef* error);
    // The container `name` of the class directory open as `classfd` (at `containerURL`).
    static std::shared_ptr<STWMetadata> readAndValidateMetadataInDirectory(int classfd, const std::string& name,
                                                                           const std::filesystem::path& containerURL,
                                                                           const STWUserIdentityRef& forUserIdentity,
                                                                           bool checkClassPath, STWErrorRef* error);

    // Larger files are not metadata the daemon wrote.
    static constexpr size_t maximumFileSize = 1u << 20;

private:
    // Reads `relativePath` beneath `dirfd` (the file at `fileURL` inside `container`). The
    // file's path is text, only for messages: a rebuild reads one file per container.
    static std::shared_ptr<STWMetadata> _readAndValidateMetadata(int dirfd, const std::string& relativePath,
                                                                 const std::string& fileURL,
                                                                 const std::filesystem::path& container,
                                                                 const STWUserIdentityRef& forUserIdentity,
                                                                 bool checkClassPath, STWErrorRef* error);
    bool _writeMetadataAt(int dirfd, const std::string& name, const std::filesystem::path& fileURL,
                          STWErrorRef* error);

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
    uint64_t _fileDevice = 0;
    uint64_t _fileInode = 0; // 0: no file known yet
};
