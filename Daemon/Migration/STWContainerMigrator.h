// The one-time corrections that bring an older release's files and containers up to the
// current layout, each recorded in a migration status store (STWMigrationStatus) so that
// it runs once.
//
// Three occasions:
// - a build upgrade, on the first start after power-on with a new build (the first-boot
//   setup asks through the STWBuildUpgrade seam, which installBuildUpgrade() fills): old
//   log files, the bundle directory an older release kept in the mobile user's home, and
//   well-known system containers still under a UUID name;
// - a data migration (command 24): ACLs of system containers, ownership of bundle
//   containers and the code-signing migrations;
// - a per-user migration (command 30): standard subdirectories of every data container
//   (once per mobile-user store) and the protection class of data containers whose app has
//   no bundle container (every time).
//
// Everything below a user's home belongs to apps: what the migrator moves there is opened
// from a trusted ancestor without following links and moved through descriptors, and
// only what was opened arrives. Moves that publish something (the bundle directory, a
// well-known container) are renames synced with both directories, so a crash leaves the
// item in one place or the other, and the cache, rebuilt from disk, finds it; a step that
// a crash cut short runs again, since the build is recorded only after the migration.
//
// One process-wide instance (sharedInstance()). The build-upgrade migration runs during
// start-up before requests are served; the other two run on a request's connection thread
// and take no lock across calls that take the identifier locks themselves. No exception
// leaves an operation: it becomes code 40.
#pragma once

#include "Daemon/Migration/STWMigrationStatus.h"
#include "Daemon/Model/STWContainerClass.h"
#include "Daemon/Model/STWMetadata.h"
#include "Daemon/Model/STWUserIdentityCache.h"
#include "common/STWError.h"

#include <memory>

class STWClientConnection;

class STWContainerMigrator {
public:
    static const std::shared_ptr<STWContainerMigrator>& sharedInstance();
    explicit STWContainerMigrator(std::shared_ptr<STWUserIdentityCache> userIdentityCache);

    const std::shared_ptr<STWUserIdentityCache>& userIdentityCache() const { return _userIdentityCache; }

    // Installs the build-upgrade seam of the first-boot setup: the system store tells an
    // upgrade, this migrator performs it and the store records the build. Call at start,
    // before the first-boot setup.
    static void installBuildUpgrade();
    // One notice line: the last build the system store recorded and its migrations.
    static void logRecordedMigrations();

    // After a build upgrade. Log files and ACL bookkeeping log their failures and go on; a
    // failed bundle-directory move or well-known migration ends it with the error.
    bool performSynchronousBuildUpgradeMigration(STWMigrationStatus& status, STWErrorRef* error);
    // Command 24. Every step runs; false with the first failure (ACLs, 62 for ownership).
    bool performDataMigratorMigrationForClientConnection(STWClientConnection& connection, STWErrorRef* error);
    // Command 30. Failures of single containers are logged; only an exception fails it.
    bool performPerUserDataMigrationForClientConnection(STWClientConnection& connection, STWErrorRef* error);

    // The steps, for the operations above and their tests.
    // Old log files of the default user's old logging directory whose extension n satisfies
    // n + 1 <= the disk-log level move into the log directory as extension n + 1; the old
    // directory is removed. Only regular files with one name move; nothing is followed.
    void _migrateOldLogFiles();
    // The bundle directory of an older release, in the mobile user's home, becomes the
    // global bundle directory (which start-up made empty). Nothing there: success.
    bool _moveLegacyBundleDirectoryWithError(STWErrorRef* error);
    void _checkIfDeviceMayNeedSystemContainerACLMigration(STWMigrationStatus& status);
    // Each well-known system (group) container not yet at its well-known name is renamed
    // there, under the daemon-wide identifier lock, and the cache follows.
    bool _performWhitelistMigrationWithError(STWErrorRef* error);
    bool _performACLMigration(STWMigrationStatus& status, STWErrorRef* error);
    bool _performBundleOwnershipMigration(STWMigrationStatus& status, STWErrorRef* error);
    void _performSubdirectoryMigrationForUserIdentity(const STWUserIdentityRef& userIdentity);
    void _performDataProtectionMigrationForUserIdentity(const STWUserIdentityRef& userIdentity);
    // A data container whose app has no bundle container gets the class its entitlements
    // ask for; one with a bundle container keeps what the installation set.
    void _setDataProtectionIfNecessaryOnContainer(const STWMetadataRef& container);
    // The bundle container of a class 2 (same identifier) or class 4 (the parent's) data
    // container; 20 for other classes, 21 when there is none.
    STWMetadataRef _bundleContainerForDataContainer(const STWMetadata& container, STWErrorRef* error);

private:
    std::shared_ptr<STWUserIdentityCache> _userIdentityCache;
};
