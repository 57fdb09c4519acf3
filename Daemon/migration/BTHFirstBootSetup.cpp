#include "BTHFirstBootSetup.h"

#include "BTHContainerMigrator.h"
#include "BTHFaultInjection.h"
#include "BTHLog.h"
#include "BTHMigrationStatus.h"
#include "BTHSystemContainerInstallation.h"

namespace berth {

namespace {

// The status to migrate with. A status file that cannot be read says
// nothing about what was done: every step runs again, each finding its own
// finished work, and the file is written anew as steps complete.
std::unique_ptr<BTHMigrationStatus> migrationStatus() {
    BTH_FUNCTION("-[BTHClientConnection rebootBerthSetup]");
    if (std::unique_ptr<BTHMigrationStatus> status = BTHMigrationStatus::make()) return status;
    BTHLogError("Migration status cannot be read; running every migration step again");
    return std::make_unique<BTHMigrationStatus>(Value::dictionary());
}

}  // namespace

void BTHRebootBerthSetup(BTHClientConnection& client) {
    BTH_FUNCTION("-[BTHClientConnection rebootBerthSetup]");
    std::unique_ptr<BTHMigrationStatus> status = migrationStatus();
    if (status->isBuildUpgrade()) {
        BTHErrorRef error;
        if (!BTHContainerMigrator::sharedInstance().performSynchronousBuildUpgradeMigration(*status,
                                                                                            &error))
            BTHLogError("Failed to perform build upgrade migration : %@", error);
        BTHCrashPoint("first-boot.after-build-upgrade-migration");
        client._regenerateAllSystemContainerPaths();
        BTHCrashPoint("first-boot.after-regenerate");
        status->writeCurrentBuildInfoToDisk();
    }
    BTHMoveSystemContainersIntoPlace(client);
}

}  // namespace berth
