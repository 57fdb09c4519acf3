// Regeneration: a container gets a fresh directory name in the same parent
// while its internal UUID, identifier, class and contents stay the same.
#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "BTHWhitelist.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"

namespace berth {

namespace {

constexpr const char* kRegenerateFunction =
    "-[BTHClientConnection "
    "regenerateDirectoryUUIDForUser:withInternalUUID:identifier:containerClass:withError:]";

constexpr uint32_t kMultiUserFlag = 0x80000000u;

}  // namespace

BTHErrorRef BTHClientConnection::regenerateOne(const BTHMetadataRef& record) {
    BTH_FUNCTION(kRegenerateFunction);
    const std::filesystem::path oldURL = record->url();
    if (!Uuid::parse(oldURL.filename().string())) {
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Non-UUID last path component: %@ for identifier: %@, userId: %u, "
                            "Class: %ld",
                            oldURL, record->identifier(), record->uid(), record->containerClass());
    }
    const std::filesystem::path newURL = oldURL.parent_path() / Uuid::random().string();
    BTHErrorRef moveError;
    if (!BTHFileManager::defaultManager().moveItemAtURL(oldURL, newURL, &moveError)) {
        return BTHMakeError(BTHErrorRegenerateMoveFailed, moveError,
                            "Failed to move dir: %@ to new UUID dir: %@", oldURL, newURL);
    }
    if (!_setSandboxContainerMappingForUser(record->uid(), record->identifier(),
                                            record->containerClass(), newURL)) {
        BTHLogError("Failed to set container mapping in regenerate operation of %@, %llu",
                    record->identifier(), record->containerClass());
    }
    BTHErrorRef cacheError;
    if (!BTHContainerCache::sharedInstance().addContainerMetadata(
            record, record->uid(), newURL, record->transient(), &cacheError)) {
        return BTHMakeError(BTHErrorCacheAddFailed, cacheError,
                            "Failed to add to cache: %@, url: %@, transient: %d", record, newURL,
                            record->transient());
    }
    return nullptr;
}

void BTHClientConnection::regenerateDirectoryUUIDForUser(
    uid_t userId, const std::optional<Uuid>& uuid, const std::optional<std::string>& identifier,
    uint64_t containerClass, uint64_t* error) {
    BTH_FUNCTION(kRegenerateFunction);
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!uuid || !BTHContainerClassIsValid(containerClass)) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld",
                                userId, uuid, containerClass);
        }
        return regenerateChosen(userId, *uuid, identifier, containerClass);
    });
    if (failure) BTHSetErrorCode(error, failure->code64());
}

BTHErrorRef BTHClientConnection::regenerateChosen(uid_t userId, const Uuid& uuid,
                                                  const std::optional<std::string>& identifier,
                                                  uint64_t containerClass) {
    BTH_FUNCTION(kRegenerateFunction);
    BTHContainerCache& cache = BTHContainerCache::sharedInstance();
    BTHMetadataRef chosen;
    if (BTHContainerClassIsPerUser(containerClass) &&
        (DeviceProperties::multiUserFlags() & kMultiUserFlag)) {
        // In multi-user mode the request means the device user's container,
        // whatever user and UUID it names.
        const uid_t deviceUser = BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
        chosen = identifier ? cache.containerForUser(deviceUser, containerClass, *identifier, false,
                                                     nullptr)
                            : nullptr;
        if (!chosen) {
            BTHLogDebug("No Container with userId: %u, identifier: %@, Class: %ld", deviceUser,
                        identifier, containerClass);
            return BTHMakeError(BTHErrorNotFound, nullptr,
                                "No Containers found with identifier: %@, Class: %ld", identifier,
                                containerClass);
        }
    } else {
        chosen = identifier
                     ? cache.containerForUser(userId, containerClass, *identifier, uuid.string())
                     : nullptr;
        if (!chosen) {
            return BTHMakeError(BTHErrorNotFound, nullptr,
                                "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                                userId, uuid.string(), identifier, containerClass);
        }
    }
    BTHAllIdentifiersLockGuard lock(true);
    return regenerateOne(chosen);
}

void BTHClientConnection::_regenerateAllSystemContainerPaths() {
    BTH_FUNCTION("-[BTHClientConnection _regenerateAllSystemContainerPaths]");
    BTHLogNotice("Rolling system container directory UUIDs on disk");
    const BTHWhitelist& whitelist = BTHWhitelist::sharedWhitelist();
    for (uint64_t containerClass :
         {uint64_t{BTHContainerClassDataSystem}, uint64_t{BTHContainerClassSharedSystemGroup}}) {
        BTHErrorRef listError;
        const auto containers = BTHContainerCache::sharedInstance().allContainersForUser(
            kBTHSystemUserId, containerClass, false, &listError);
        if (!containers) {
            BTHLogError("Failed to get list of system containers for migration: %@", listError);
            continue;
        }
        for (const BTHMetadataRef& container : *containers) {
            const std::string& identifier = container->identifier();
            if (identifier.empty() ||
                whitelist.containerIdIsWellknown(identifier, containerClass) ||
                identifier == "systemgroup.sys.kelp.tallyworks")
                continue;
            uint64_t result = BTHErrorSuccess;
            regenerateDirectoryUUIDForUser(kBTHSystemUserId, container->uuid(), identifier,
                                           containerClass, &result);
            if (result != BTHErrorSuccess) {
                BTHLogError("Failed to regenerate directory UUID for identifier: %@, class: %llu",
                            identifier, containerClass);
            }
        }
    }
}

}  // namespace berth
