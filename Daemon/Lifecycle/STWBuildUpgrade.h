// What the first start after power-on asks of the migration subsystem: whether the
// system's build changed since the daemon last recorded it, the migration that runs once
// it did, and the record of the current build.
//
// Lifecycle sits below Migration, so the migrator fills this seam rather than being called
// by name: stowlyd's start-up installs its implementation
// (STWContainerMigrator::installBuildUpgrade(), which answers from the system migration
// status store) before the first-boot setup of STWClientConnection calls installed().
// Where none is installed (a process that runs the setup without the migrator) nothing can
// tell an upgrade, so every start counts as none (said at debug level). install() and
// installed() are safe from any thread.
#pragma once

#include "common/STWError.h"

#include <memory>

class STWBuildUpgrade {
public:
    virtual ~STWBuildUpgrade() = default;

    // True when the recorded build differs from the running one.
    virtual bool isBuildUpgrade() = 0;
    // Runs the data migrations of a build upgrade; false with the error when one failed.
    virtual bool performSynchronousBuildUpgradeMigration(STWErrorRef* error) = 0;
    // Records the running build, so that the next power-on is no upgrade.
    virtual void writeCurrentBuildInfoToDisk() = 0;

    static void install(std::shared_ptr<STWBuildUpgrade> upgrade);
    // nullptr while none is installed.
    static std::shared_ptr<STWBuildUpgrade> installed();
};
