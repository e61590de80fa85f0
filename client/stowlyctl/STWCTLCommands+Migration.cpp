// The migrations a build upgrade asks for: migrate (the device-wide data migration) and
// migrate-user (the current user's). Neither takes keys; the reply says how it went.
#include "client/stowlyctl/STWCTLCommands.h"

void STWCTLCommands::_addMigrationCommands(CLI::App& app) {
    auto none = [](STWCTLSession&, STWValue::Dictionary&) { return 0; };
    _addVerb(app, "migrate", 24, "Run the data migration of a build upgrade (dataMigration entitlement)",
             none);
    _addVerb(app, "migrate-user", 30, "Run the per-user data migration of a build upgrade", none);
}
