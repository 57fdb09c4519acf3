// The first start of the daemon after the device booted, before the upcall
// service is up: a new build's upgrade migration, the system container paths
// rolled and the build recorded, then the installation of system containers
// the operating system prepared.
#pragma once

#include "BTHClientConnection.h"

namespace berth {

// Runs on the daemon's own client object; failures are logged and the next
// step runs. The build is recorded after its migration whatever the
// migration's outcome, so a failing step is not retried at every boot.
void BTHRebootBerthSetup(BTHClientConnection& client);

}  // namespace berth
