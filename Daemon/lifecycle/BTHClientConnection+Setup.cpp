// What every start of the daemon does to the container store before it
// serves requests: finish or undo interrupted replaces, then send staging
// leftovers to death row and empty it.
#include "BTHClientConnection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"

namespace berth {

void BTHClientConnection::berthSetup() {
    BTH_FUNCTION("-[BTHClientConnection berthSetup]");
    if (!_recoverFromReplaceOperationsWithError(nullptr))
        BTHLogError("Failed recovering from replace operations");
}

void BTHClientConnection::berthCleanup() {
    BTH_FUNCTION("-[BTHClientConnection berthCleanup]");
    const std::filesystem::path staging =
        BTHGlobalConfiguration::sharedInstance().stagingDirectory();
    BTHErrorRef listError;
    const auto leftovers =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(staging, &listError);
    if (leftovers) {
        for (const BTHFileURL& item : *leftovers)
            _moveItemAtURLToDeathRow(item.path, true, false, nullptr);
    } else if (!listError || !listError->isPOSIXError(ENOENT)) {
        BTHLogError("Failed to get items at staging URL%@ : %@", staging, listError);
    }
    deleteContainersOnDeathRowWithCompletion(nullptr);
}

}  // namespace berth
