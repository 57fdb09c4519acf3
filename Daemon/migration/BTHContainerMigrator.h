// BTHContainerMigrator: moves what older releases left into the places and
// shapes the daemon uses now. It has no state of its own: what it has done
// is in the migration status file and on disk, so every step can be run
// again after a crash and finds its own work already done.
//
// Two entry points:
//   - the build-upgrade migration, at the first start after boot of a new
//     build: old per-user library and log directories, the bundle
//     containers' old location, whether system containers still need their
//     access control lists, well-known system containers to their fixed
//     names;
//   - the data migration, on request: access control lists of system
//     containers and ownership of bundle containers (once each), then the
//     code-signing migrations and group reconciliation (every time).
#pragma once

#include "BTHError.h"
#include "BTHMigrationStatus.h"

namespace berth {

// Where older releases kept the bundle containers.
inline constexpr const char* kBTHOldBundleContainersPath = "/private/var/mobile/Containers/Bundle";

class BTHContainerMigrator {
  public:
    static BTHContainerMigrator& sharedInstance();

    // The build-upgrade migration. False when the bundle containers could
    // not be moved from their old place (no error handed out) or a
    // well-known system container could not be moved to its fixed name (the
    // error handed out); every other failure is logged and passed over.
    bool performSynchronousBuildUpgradeMigration(BTHMigrationStatus& status, BTHErrorRef* error);

    // The data migration. False, with the last failed step's error, when a
    // one-time step failed; the code-signing migrations run in every case.
    // An exception becomes error 40.
    bool performDataMigratorMigrationWithError(BTHErrorRef* error);

    // Steps, for the tests.
    void _checkIfDeviceMayNeedSystemContainerACLMigration(BTHMigrationStatus& status);
    bool _performWhitelistMigrationWithError(BTHErrorRef* error);
    bool _performInternalACLMigrationWithError(BTHErrorRef* error);
    bool _performBundleContainerOwnershipMigrationWithError(BTHErrorRef* error);

  private:
    BTHContainerMigrator() = default;

    // Old per-user library and log directories of user 501.
    void migrateOldUserDirectories();
    void migrateOldLogFiles(const std::filesystem::path& oldLoggingPath);
    // One class's well-known system containers to their fixed names.
    bool migrateWellKnownContainersOfClass(uint64_t containerClass, BTHErrorRef* error);
    bool performDataMigrationSteps(BTHErrorRef* error);
};

}  // namespace berth
