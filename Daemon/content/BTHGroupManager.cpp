#include "BTHGroupManager.h"

#include <algorithm>

#include "BTHContainerCache.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"

namespace berth {

namespace {

constexpr const char* kPathsFunction =
    "-[BTHGroupManager groupContainerPathsForUser:clientConnection:identifier:withError:]";
constexpr const char* kIdentifiersFunction =
    "-[BTHGroupManager groupContainerIdentifiersForUser:identifier:withError:]";

struct GroupKeys {
    const char* key;
    const char* fallBackKey;
};

// Any type but the system groups' is the application groups'.
GroupKeys keysOfType(BTHGroupType type) {
    if (type == BTHGroupTypeSystem)
        return {kBTHSystemGroupsEntitlement, kBTHSystemGroupContainersEntitlement};
    return {kBTHApplicationGroupsEntitlement, nullptr};
}

// Stages one container for deletion without identifier locking (the caller
// holds the all-identifiers lock); the code of the staging.
uint64_t stageForDelete(uid_t userId, const Uuid& uuid, const std::string& identifier,
                        uint64_t containerClass) {
    uint64_t code = BTHErrorSuccess;
    BTHClientConnection::sharedClientConnection()->stageForDeleteContainersWithUsers(
        {userId}, {uuid}, std::vector<std::optional<std::string>>{identifier},
        {Value(containerClass)}, false, &code);
    return code;
}

uint64_t stageForDelete(uid_t userId, const BTHMetadata& container) {
    return stageForDelete(userId, container.uuid(), container.identifier(),
                          container.containerClass());
}

}  // namespace

BTHGroupManager& BTHGroupManager::defaultManager() {
    static BTHGroupManager manager(BTHCodeSigningMapping::sharedInstance());
    return manager;
}

std::optional<BTHGroupManager::GroupPaths> BTHGroupManager::groupContainerPathsForUser(
    uid_t userId, BTHClientConnection& client, const std::optional<std::string>& identifier,
    uint64_t* error) {
    BTH_FUNCTION(kPathsFunction);
    if (!identifier) {
        BTHMakeError(BTHErrorInvalidArgument, nullptr,
                     "Can't act on an invalid object: userId: %u, ID: %@", userId, identifier);
        BTHSetErrorCode(error, BTHErrorInvalidArgument);
        return std::nullopt;
    }
    GroupPaths paths;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
        BTHAllIdentifiersLockGuard lock(true);
        const bool system = userId == kBTHSystemUserId;
        const uint64_t containerClass =
            system ? BTHContainerClassSharedSystemGroup : BTHContainerClassSharedAppGroup;
        std::optional<std::vector<std::string>> groups;
        if (mapping_)
            groups = system ? mapping_->systemGroupIdentifiersForIdentifier(*identifier)
                            : mapping_->appGroupIdentifiersForIdentifier(*identifier);
        if (client.clientBundleIdentifier() != identifier && !client.allowOtherIdLookup() &&
            DeviceProperties::isInternalBuild()) {
            BTHLogWarning(
                "%@ trying to retrieve group containers of class %ld for identifier: %@. WARNING: "
                "Soon you will need an entitlement to do this. File a Snag in \"Berth | all\"",
                client.clientBundleIdentifier(), containerClass, *identifier);
        }
        client.setAllowGroupIdLookup(true);
        for (const std::string& group : groups.value_or(std::vector<std::string>{})) {
            uint64_t code = BTHErrorSuccess;
            const BTHMetadataRef container = client.createOrLookupContainerForUser(
                userId, group, true, containerClass, false, false, &code);
            if (container) {
                paths[group] = container->url().string();
            } else {
                BTHLogError("Failed to create or lookup group container-userId: %u, ID: %@ : %llu",
                            userId, *identifier, code);
            }
        }
        return nullptr;
    });
    if (failure) {
        BTHSetErrorCode(error, failure->code64());
        return std::nullopt;
    }
    return paths;
}

std::optional<std::vector<std::string>> BTHGroupManager::groupContainerIdentifiersForUser(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t* error) {
    BTH_FUNCTION(kIdentifiersFunction);
    if (!identifier) {
        BTHMakeError(BTHErrorInvalidArgument, nullptr,
                     "Can't act on an invalid object: userId: %u, ID: %@", userId, identifier);
        BTHSetErrorCode(error, BTHErrorInvalidArgument);
        return std::nullopt;
    }
    std::vector<std::string> groups;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
        BTHAllIdentifiersLockGuard lock(true);
        if (mapping_)
            groups = mapping_->appGroupIdentifiersForIdentifier(*identifier)
                         .value_or(std::vector<std::string>{});
        return nullptr;
    });
    if (failure) {
        BTHSetErrorCode(error, failure->code64());
        return std::nullopt;
    }
    return groups;
}

std::optional<BTHGroupManager::ReferenceCounts> BTHGroupManager::copyReferenceCountSetOfType(
    BTHGroupType type) {
    BTH_FUNCTION("-[BTHGroupManager _copyReferenceCountSetOfType:]");
    if (!mapping_) return std::nullopt;
    const GroupKeys keys = keysOfType(type);
    ReferenceCounts counts;
    mapping_->iterateGroupIdsWithKey(
        keys.key, keys.fallBackKey,
        [&](const std::string& identifier, const std::optional<std::vector<std::string>>& groups) {
            if (!groups) return;
            BTHLogDebug("Entitlements for identifier %@ references container IDs: %@", identifier,
                        BTHStringListValue(*groups));
            for (const std::string& group : *groups) ++counts[group];
        });
    return counts;
}

void BTHGroupManager::handleChangeFromOldGroupContainerIds(
    std::optional<std::vector<std::string>> oldIds,
    const std::optional<std::vector<std::string>>& newIds, BTHGroupType type) {
    if (oldIds == newIds) return;
    if (!oldIds) return;
    if (newIds) {
        std::erase_if(*oldIds, [&](const std::string& group) {
            return std::find(newIds->begin(), newIds->end(), group) != newIds->end();
        });
    }
    removeReferenceForGroupIdentifiers(*oldIds, type);
}

std::optional<uid_t> BTHGroupManager::mobileUserWithBaseDirectory() {
    BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
    const uid_t user = configuration.currentMobileUserId();
    auto perUser = configuration.getPerUserConfigurationForUserId(user);
    if (!perUser || !perUser->existsUserBaseDirectory()) return std::nullopt;
    return user;
}

void BTHGroupManager::removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups,
                                                         BTHGroupType type) {
    BTH_FUNCTION("-[BTHGroupManager _removeReferenceForGroupIdentifiers:ofType:]");
    if (groups.empty()) return;
    std::optional<ReferenceCounts> counts = copyReferenceCountSetOfType(type);
    if (!counts) {
        BTHLogError("Failed to get reference count information for group type: %ld", int64_t{type});
        return;
    }
    if (type == BTHGroupTypeSystem) {
        removeGroupContainersIfNeeded(kBTHSystemUserId, BTHContainerClassSharedSystemGroup, groups,
                                      *counts);
    } else if (std::optional<uid_t> user = mobileUserWithBaseDirectory()) {
        removeGroupContainersIfNeeded(*user, BTHContainerClassSharedAppGroup, groups, *counts);
    }
}

void BTHGroupManager::removeGroupContainersIfNeeded(uid_t userId, uint64_t containerClass,
                                                    const std::vector<std::string>& groups,
                                                    ReferenceCounts& counts) {
    BTH_FUNCTION(
        "-[BTHGroupManager "
        "_removeGroupContainersIfNeededforUser:groupContainerClass:identifiers:referenceCounts:]");
    for (const std::string& group : groups) {
        auto counted = counts.find(group);
        const long count = counted == counts.end() ? 0 : counted->second;
        if (count == 1) {
            BTHErrorRef lookupError;
            const BTHMetadataRef container = BTHContainerCache::sharedInstance().containerForUser(
                userId, containerClass, group, false, &lookupError);
            if (!container) {
                BTHLogDebug(
                    "Failed to retrieve group container %@ for %u : %@.  May not exist for this "
                    "user",
                    group, userId, lookupError);
            } else {
                BTHLogNotice(
                    "Last reference to group container %@ for %u is going away; removing it.",
                    group, userId);
                const uint64_t code = stageForDelete(userId, *container);
                if (code != BTHErrorSuccess)
                    BTHLogError("Failed to destroy group container with identifier %@ for %u: %llu",
                                group, userId, code);
            }
        } else {
            BTHLogDebug("Reference count for user: %u, ID: %@ is %ld", userId, group, count);
        }
        if (counted != counts.end() && --counted->second <= 0) counts.erase(counted);
    }
}

void BTHGroupManager::reconcileGroupContainersOfType(BTHGroupType type) {
    BTH_FUNCTION("-[BTHGroupManager reconcileGroupContainersOfType:]");
    std::optional<ReferenceCounts> counts = copyReferenceCountSetOfType(type);
    if (!counts) {
        BTHLogError("Failed to get reference count information for group type: %ld", int64_t{type});
        return;
    }
    if (type == BTHGroupTypeSystem) {
        cleanupUnreferencedGroupContainers(kBTHSystemUserId, BTHContainerClassSharedSystemGroup,
                                           *counts);
    } else if (std::optional<uid_t> user = mobileUserWithBaseDirectory()) {
        cleanupUnreferencedGroupContainers(*user, BTHContainerClassSharedAppGroup, *counts);
    }
}

void BTHGroupManager::cleanupUnreferencedGroupContainers(uid_t userId, uint64_t containerClass,
                                                         const ReferenceCounts& counts) {
    BTH_FUNCTION(
        "-[BTHGroupManager _cleanupUnreferencedGroupContainersForUser:containerClass:"
        "referenceCounts:]");
    BTHErrorRef listError;
    auto containers = BTHContainerCache::sharedInstance().allContainersForUser(
        userId, containerClass, false, &listError);
    if (!containers) {
        BTHLogError("Failed to fetch group container list for %u: %@", userId, listError);
        return;
    }
    for (const BTHMetadataRef& container : *containers) {
        if (counts.contains(container->identifier())) continue;
        BTHLogError("Removing group container with identifier %@ for %u", container->identifier(),
                    userId);
        const uint64_t code = stageForDelete(userId, *container);
        if (code != BTHErrorSuccess)
            BTHLogError("Failed to destroy group container with identifier %@ for %u: %llu",
                        container->identifier(), userId, code);
    }
}

BTHCodeSigningHooks BTHMakeCodeSigningHooks(BTHGroupManager& groups) {
    BTHCodeSigningHooks hooks;
    hooks.withAllIdentifiersLocked = [](const std::function<void()>& work) {
        BTHAllIdentifiersLockGuard lock(true);
        work();
    };
    hooks.stageForDelete = [](uid_t user, const Uuid& uuid, const std::string& identifier,
                              uint64_t containerClass) {
        return stageForDelete(user, uuid, identifier, containerClass);
    };
    hooks.groupContainerIdsChanged =
        [&groups](std::optional<std::vector<std::string>> oldIds,
                  const std::optional<std::vector<std::string>>& newIds, BTHGroupType type) {
            groups.handleChangeFromOldGroupContainerIds(std::move(oldIds), newIds, type);
        };
    return hooks;
}

}  // namespace berth
