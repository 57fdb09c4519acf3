// Death row: containers are not removed file by file while a request waits.
// They are renamed into the death-row directory, and the trees there are
// destroyed later, one after the other, on the serial death-row queue. What
// is still there when the daemon stops is destroyed after its next start.
#include "BTHAsyncWork.h"
#include "BTHClientConnection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "platform/DeviceRoot.h"

namespace berth {

bool BTHClientConnection::_moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                                   bool startDeletionThread, BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection _moveItemAtURLToDeathRow:isDir:startDeletionThread:error:]");
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    // Emptying death row destroys every slot it lists, a slot made here for
    // a move that has not happened yet included: the move then finds no
    // destination and takes a new slot. Only a missing item is already gone.
    constexpr int kSlotAttempts = 8;
    BTHErrorRef moveError;
    std::filesystem::path tried;  // the last destination, for the error
    for (int attempt = 0; attempt < kSlotAttempts; ++attempt) {
        const std::optional<BTHFileURL> slot = fileManager.createTemporaryDirectoryInDirectoryURL(
            BTHGlobalConfiguration::sharedInstance().deathrowDirectory(), &moveError);
        if (!slot) {
            BTHSetError(error, BTHMakeError(BTHErrorMoveToDeathRowFailed, moveError,
                                            "Failed to create unique directory at: %@", url));
            return false;
        }
        const BTHFileURL destination{slot->path / url.filename(), isDir};
        tried = destination.path;
        if (fileManager.moveItemAtURL(url, destination.path, &moveError)) {
            if (startDeletionThread) deleteContainersOnDeathRowWithCompletion(nullptr);
            return true;
        }
        if (!moveError || !moveError->isPOSIXError(ENOENT)) break;
        // Already gone: nothing to destroy; the empty slot goes with the next
        // emptying.
        if (fileManager.itemDoesNotExistAtURL(url)) return true;
    }
    BTHSetError(error, BTHMakeError(BTHErrorMoveToDeathRowFailed, moveError,
                                    "Failed to move item at: %@ to: %@", url, tried));
    return false;
}

void BTHClientConnection::deleteContainersOnDeathRowWithCompletion(
    std::function<void(uint64_t)> completion) {
    // The work needs nothing of this caller: the daemon's own client object
    // outlives it.
    BTHPerformAsyncWork(BTHDeathRowQueue(), [completion = std::move(completion)] {
        BTHClientConnection& self = *sharedClientConnection();
        BTH_FUNCTION("-[BTHClientConnection deleteContainersOnDeathRowWithCompletion:]_block");
        const std::filesystem::path deathRow =
            BTHGlobalConfiguration::sharedInstance().deathrowDirectory();
        BTHErrorRef failure;
        BTHErrorRef listError;
        const auto items =
            BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(deathRow, &listError);
        if (!items) {
            if (!listError || !listError->isPOSIXError(ENOENT)) {
                failure =
                    BTHMakeError(BTHErrorDeleteFailed, listError,
                                 "Failed to get items for deletion: %@ : %@", deathRow, listError);
            }
        } else {
            for (const BTHFileURL& item : *items) {
                BTHErrorRef removeError;
                if (!self._removeItemOrMoveToTempAtURL(item.path, &removeError)) {
                    failure = BTHMakeError(BTHErrorDestroyFailed, removeError,
                                           "Failed to destroy item at: %@", item.path);
                }
            }
        }
        if (completion) completion(failure ? failure->code64() : uint64_t{BTHErrorSuccess});
    });
}

bool BTHClientConnection::_removeItemOrMoveToTempAtURL(const std::filesystem::path& url,
                                                       BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHClientConnection _removeItemOrMoveToTempAtURL:error:]");
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    BTHErrorRef removeError;
    if (fileManager.removeItemAtURL(url, &removeError)) return true;
    if (removeError && removeError->isPOSIXError(ENOENT)) return true;
    BTHLogDebug("Couldn't remove, so moving item to /tmp: %@ : %@", url, removeError);
    const std::filesystem::path temp = DeviceRoot::resolve("/tmp");
    BTHErrorRef moveError;
    if (!fileManager.moveItemAtURL(url, temp / url.filename(), &moveError)) {
        // Gone after all (the removal reported an item that later vanished).
        if (moveError && moveError->isPOSIXError(ENOENT) && fileManager.itemDoesNotExistAtURL(url))
            return true;
        BTHSetError(error, BTHMakeError(BTHErrorMoveAsideFailed, moveError,
                                        "Failed to move dir: %@ to: %@", url, "/tmp"));
        return false;
    }
    return true;
}

}  // namespace berth
