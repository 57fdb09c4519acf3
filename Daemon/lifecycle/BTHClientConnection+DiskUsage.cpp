// The disk usage of one container, measured under its identifier lock so it
// cannot be deleted or replaced while it is measured. A bundle container's
// contents do not change once installed, so its first measurement is kept
// among its info values and answered from there afterwards.
#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kStaticDiskUsageKey = "sys.kelp.Lading.StaticDiskUsage";

}  // namespace

uint64_t BTHClientConnection::diskUsageForUserId(uid_t userId, const std::optional<Uuid>& uuid,
                                                 const std::optional<std::string>& identifier,
                                                 uint64_t containerClass, uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection diskUsageForUserId:uuid:identifier:containerClass:withError:]");
    uint64_t usage = 0;
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!uuid || !BTHContainerClassIsValid(containerClass)) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld",
                                userId, uuid, containerClass);
        }
        const std::string uuidString = uuid->string();
        BTHIdentifierLockGuard lock(uuidString, true);
        const BTHMetadataRef record = identifier
                                          ? BTHContainerCache::sharedInstance().containerForUser(
                                                userId, containerClass, *identifier, uuidString)
                                          : nullptr;
        if (!record) {
            return BTHMakeError(BTHErrorNotFound, nullptr,
                                "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                                userId, uuidString, identifier, containerClass);
        }
        const bool isBundle = BTHContainerClassIsBundle(containerClass);
        if (isBundle) {
            uint64_t readError = BTHErrorSuccess;
            const std::optional<Value> stored =
                infoValueForKey(std::string(kStaticDiskUsageKey), userId, uuid, identifier,
                                containerClass, false, &readError);
            if (readError != BTHErrorSuccess && readError != BTHErrorInfoValueNotFound)
                BTHLogError(
                    "Error looking up info value for userId: %u, identifier: %@, Class: %llu: "
                    "%llu",
                    userId, identifier, containerClass, readError);
            if (stored && stored->uint64Value()) {
                usage = *stored->uint64Value();
                return BTHErrorRef();
            }
        }
        usage = BTHFileManager::defaultManager().diskUsageForURL(record->url());
        if (isBundle) {
            uint64_t writeError = BTHErrorSuccess;
            setInfoValue(Value(usage), std::string(kStaticDiskUsageKey), userId, uuid, identifier,
                         containerClass, false, &writeError);
            if (writeError != BTHErrorSuccess)
                BTHLogError(
                    "Error setting info value for userId: %u, identifier: %@, Class: %llu: %llu",
                    userId, identifier, containerClass, writeError);
        }
        return BTHErrorRef();
    });
    if (failure) {
        usage = 0;
        BTHSetErrorCode(error, failure->code64());
    }
    return usage;
}

}  // namespace berth
