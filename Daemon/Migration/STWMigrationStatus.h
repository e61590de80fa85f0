// Which one-time migrations have completed on this device, and which build the daemon
// last recorded itself on, so that every migration runs once and a build upgrade is told
// from an ordinary start.
//
// Two stores, each a property-list dictionary in a file of its own: the system store
// ("stw_migration_status.plist" in the daemon's library directory) and the mobile-user
// store ("stw_user_migration_status.plist" in the default user's library directory). A
// completed migration is a key, its type name, whose value records the build and the date
// of completion; "LastBuildInfo" holds the version dictionary of the last recorded build.
// Older daemons kept one marker file per migration; the system store folds them in once.
//
// The mobile-user store lies in a directory the user's apps own: both stores are read and
// written through the directory's descriptor, opened without following a link below the
// home, and only a regular file is read (a link or FIFO planted there is an unreadable
// store). A write goes to a synced file beside the store, renamed over it.
//
// A store is read when it is made. Every write first takes in what another store object
// wrote to the same file meanwhile, under one process-wide lock, so two requests that
// record different migrations at once both stay recorded.
#pragma once

#include "common/STWError.h"
#include "common/STWThreadSafety.h"
#include "common/STWValue.h"

#include <filesystem>
#include <memory>
#include <optional>
#include <string>

namespace STWMigrationType {
inline constexpr const char* bundle = "BundleMigration";
inline constexpr const char* acl = "ACLMigration";
inline constexpr const char* groupId = "GroupIdMigration";
inline constexpr const char* codeSigning = "CodeSigningMigration";
inline constexpr const char* subdirectory = "SubdirectoryMigration";
} // namespace STWMigrationType

class STWMigrationStatus {
public:
    static constexpr const char* systemFileName = "stw_migration_status.plist";
    static constexpr const char* userFileName = "stw_user_migration_status.plist";
    static constexpr const char* lastBuildInfoKey = "LastBuildInfo";
    static constexpr const char* versionNumberKey = "STWMigrationVersionNumber";
    static constexpr const char* timeKey = "STWMigrationTime";

    static std::shared_ptr<STWMigrationStatus> initForSystemMigration();
    static std::shared_ptr<STWMigrationStatus> initForMobileUserMigration();
    // A store over any file (tests, tools); `foldMarkerFiles` as for the system store, with
    // the marker files beside `url`. Below `trustedAncestor` (a user's home, whose Library
    // its apps own) the file is reached without following a link.
    STWMigrationStatus(std::filesystem::path url, bool foldMarkerFiles,
                       std::filesystem::path trustedAncestor = {});

    const std::filesystem::path& migrationFileURL() const { return _migrationFileURL; }
    // nullopt when the file exists but could not be read.
    std::optional<STWValue::Dictionary> migrationInfo();

    bool hasMigrationOccurredForType(const std::string& type);
    // Records the type with the running build and the date, and writes the store.
    void setMigrationCompleteForType(const std::string& type);
    // Records the running system's version dictionary as the last build, and writes.
    void writeCurrentBuildInfoToDisk();
    // True unless the last recorded build is the running one.
    bool isBuildUpgrade();

    // The running system's build version ("BuildVersion" of its version dictionary), read
    // once; empty when the system does not say.
    static std::string currentBuildVersion();

    // Reads a store file: an absent file is an empty store; nullopt (logged) when it exists
    // but is not a readable property-list dictionary in a regular file.
    static std::optional<STWValue::Dictionary> readMigrationInfo(const std::filesystem::path& url,
                                                                 const std::filesystem::path& trustedAncestor = {});

private:
    // Takes the marker files of older daemons into the store, writes it, then removes them.
    void _foldMarkerFiles() STW_REQUIRES(_fileLock);
    // Takes in what the file holds now (another store object may have written it), applies
    // `change` and writes; under the process-wide lock. False (logged) when the file could
    // not be read, which leaves it untouched, or not be written.
    template <class Change>
    bool _update(const std::string& what, Change&& change);

    // One lock for every store object of the process: two objects may share a file.
    static STWMutex _fileLock;

    // Writes the dictionary through the directory's descriptor, durably.
    bool _writeMigrationInfo(STWErrorRef* error) STW_REQUIRES(_fileLock);

    std::filesystem::path _migrationFileURL;
    std::filesystem::path _trustedAncestor;
    std::optional<STWValue::Dictionary> _migrationInfo STW_GUARDED_BY(_fileLock);
};
