#include "BTHDataProtectionChangeOperation.h"

#include <cerrno>
#include <cstring>

#include "BTHAsyncWork.h"
#include "BTHClientConnection.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "platform/TreeWalk.h"

namespace berth {

namespace {

std::string errorText(int errnum) {
    char buffer[256];
    return ::strerror_r(errnum, buffer, sizeof buffer);
}

// Class 2 is never set here, and items already in it keep it.
constexpr int32_t kUntouchableClass = 2;

bool isPOSIXError(const BTHErrorRef& error, int errnum) {
    return error && error->isPOSIXError(errnum);
}

}  // namespace

BTHDataProtectionChangeOperation::BTHDataProtectionChangeOperation(
    std::shared_ptr<const BTHMetadata> metadata, int32_t newClass, bool retryIfLocked,
    int32_t changeType)
    : dataContainerMetadata_(std::move(metadata)),
      newDataProtectionClass_(newClass),
      retryIfLocked_(retryIfLocked),
      operationType_(changeType) {}

std::shared_ptr<BTHDataProtectionChangeOperation>
BTHDataProtectionChangeOperation::dataProtectionChangeOperationWithContainerMetadata(
    std::shared_ptr<const BTHMetadata> metadata, int32_t newClass, bool retryIfLocked,
    int32_t changeType) {
    return std::make_shared<BTHDataProtectionChangeOperation>(std::move(metadata), newClass,
                                                              retryIfLocked, changeType);
}

void BTHDataProtectionChangeOperation::performChangeOperation() {
    BTH_FUNCTION("-[BTHDataProtectionChangeOperation performChangeOperation]");
    const BTHMetadata& container = *dataContainerMetadata_;
    bool needRetry = false;
    BTHErrorRef error;
    if (!runChangeOperation(&needRetry, &error)) {
        needRetry = false;
        BTHLogNotice(
            "Operation to update protection classes for user: %u, id: %@, containerClass: %llu "
            "to class %d failed with error %@",
            container.uid(), container.identifier(), container.containerClass(),
            newDataProtectionClass_, error);
    }
    if (!needRetry) {
        if (completionBlock_) completionBlock_(false, error);
        return;
    }
    if (!retryIfLocked_) {
        const BTHErrorRef locked = BTHMakeError(
            BTHErrorDeviceLocked, error,
            "Tried to update user: %u, id: %@, containerClass: %llu to protection class %d, but "
            "was locked and didn't retry",
            container.uid(), container.identifier(), container.containerClass(),
            newDataProtectionClass_);
        if (completionBlock_) completionBlock_(true, locked);
        return;
    }
    BTHLogNotice(
        "Retrying container protection update to %d on next unlock for user: %u, id: %@, "
        "containerClass: %llu",
        newDataProtectionClass_, container.uid(), container.identifier(),
        container.containerClass());
    retryAfterUnlock();
}

void BTHDataProtectionChangeOperation::retryAfterUnlock() {
    // The queued work holds the operation alive until it has run.
    BTHPerformAsyncWork(BTHLockStateQueue(), [self = shared_from_this()] {
        if (!self->retried_ && self->retryStartBlock_) self->retryStartBlock_();
        self->retried_ = true;
        self->performChangeOperation();
    });
}

bool BTHDataProtectionChangeOperation::runChangeOperation(bool* needRetry, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHDataProtectionChangeOperation _runChangeOperationNeedToRetry:withError:]");
    *needRetry = false;
    const BTHMetadata& expected = *dataContainerMetadata_;
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        BTHIdentifierLockGuard lock(expected.uuid().string(), false);
        uint64_t lookupError = BTHErrorSuccess;
        const BTHMetadataRef current =
            BTHClientConnection::sharedClientConnection()->createOrLookupContainerForUser(
                expected.uid(), expected.identifier(), false, expected.containerClass(), false,
                false, &lookupError);
        if (!current) {
            return BTHMakeError(BTHErrorNotFound, nullptr,
                                "Failed to lookup container to set data protection for userId: "
                                "%u, identifier: %@, Class: %llu",
                                expected.uid(), expected.identifier(), expected.containerClass());
        }
        if (current->url() != expected.url()) {
            return BTHMakeError(BTHErrorInvalidPath, nullptr,
                                "Cancelling data protection operation because container path "
                                "changed on disk. This indicates the app may have been updated "
                                "and changed its protection level.");
        }
        std::vector<std::filesystem::path> items;
        for (const std::string& name : BTHGlobalConfiguration::appUserDataItemNames()) {
            const std::filesystem::path item = expected.url() / name;
            if (BTHFileManager::defaultManager().itemExistsAtURL(item)) items.push_back(item);
        }
        BTHErrorRef walkFailure;
        if (items.empty() || changeItems(items, &walkFailure)) return BTHErrorRef();
        if (isPOSIXError(walkFailure, EPERM)) {
            // The item's class keeps it out of reach while the device is
            // locked: try again after the next unlock.
            *needRetry = true;
            return BTHErrorRef();
        }
        return walkFailure;
    });
    if (failure) {
        *needRetry = false;
        BTHSetError(error, failure);
        return false;
    }
    return true;
}

bool BTHDataProtectionChangeOperation::changeItems(const std::vector<std::filesystem::path>& items,
                                                   BTHErrorRef* failure) {
    BTH_FUNCTION("-[BTHDataProtectionChangeOperation _runChangeOperationNeedToRetry:withError:]");
    for (const std::filesystem::path& item : items) {
        fs::TreeWalk walk(item);
        while (const BTHWalkEntry* entry = walk.next())
            if (!changeEntry(*entry, failure)) return false;
        if (walk.error() != 0)
            BTHLogError("FTS returned error for %s : %s", walk.errorPath(),
                        errorText(walk.error()));
    }
    return true;
}

bool BTHDataProtectionChangeOperation::changeEntry(const BTHWalkEntry& entry,
                                                   BTHErrorRef* failure) {
    BTH_FUNCTION("-[BTHDataProtectionChangeOperation _runChangeOperationNeedToRetry:withError:]");
    using Kind = BTHWalkEntry::Kind;
    const int32_t newClass = newDataProtectionClass_;
    int32_t target = newClass;
    BTHFileManager::ProtectionPredicate predicate;
    switch (entry.kind) {
        case Kind::DirectoryPre:
        case Kind::Symlink:
        case Kind::Other:
            return true;
        case Kind::DirectoryPost:
            if (!(operationType_ & kChangeDirectories)) return true;
            predicate = [&](int32_t current) {
                if (current == kUntouchableClass) return false;
                BTHLogDebug("Setting protection class of %s to %d", entry.path, target);
                return true;
            };
            break;
        case Kind::File:
            if (!(operationType_ & kChangeFiles)) return true;
            // Files have no class 0 of their own: it means class 3 for them.
            if (target == 0) target = 3;
            predicate = [&](int32_t current) {
                if (current == kUntouchableClass || current == target) return false;
                if (current < target && (operationType_ & kKeepStrongerFiles)) return false;
                BTHLogDebug("Setting protection class of %s to %d", entry.path, target);
                return true;
            };
            break;
        default:
            BTHLogError("FTS returned error for %s : %s", entry.path, errorText(entry.errnum));
            return true;
    }
    BTHErrorRef error;
    if (BTHFileManager::defaultManager().setDataProtectionClassOfItemAtURL(entry.path, target,
                                                                           predicate, &error))
        return true;
    if (isPOSIXError(error, EBADF)) {
        BTHLogError("Ignoring failure to set protection class to %d on %@ (mode 0%o): %@", target,
                    entry.path, static_cast<unsigned>(entry.st.st_mode), error);
        return true;
    }
    *failure = std::move(error);
    return false;
}

}  // namespace berth
