// Removing containers: staging them for deletion (one rename each into death
// row, out of the cache and the sandbox mapping), deleting one container by
// identifier, and wiping a data container's contents while it keeps its
// identity.
#include <algorithm>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kStageFunction =
    "-[BTHClientConnection "
    "stageForDeleteContainersWithUsers:UUIDs:identifiers:classes:useLocking:withError:]";

}  // namespace

BTHErrorRef BTHClientConnection::stageOneForDelete(uid_t userId, const std::optional<Uuid>& uuid,
                                                   const std::optional<std::string>& identifier,
                                                   const Value& classValue) {
    BTH_FUNCTION(kStageFunction);
    if (!classValue.isInteger()) {
        BTHMakeError(BTHErrorInvalidArgument, nullptr, "Can't act on an invalid object: class: %@",
                     classValue);
        return nullptr;
    }
    const uint64_t containerClass = *classValue.uint64Value();
    if (!uuid || !identifier || !BTHContainerClassIsValid(containerClass)) {
        BTHMakeError(BTHErrorInvalidArgument, nullptr,
                     "Can't act on an invalid object: userId: %u, UUID: %@, ID: %@, Class: %ld",
                     userId, uuid, identifier, containerClass);
        return nullptr;
    }
    BTHContainerCache& cache = BTHContainerCache::sharedInstance();
    const BTHMetadataRef record =
        cache.containerForUser(userId, containerClass, *identifier, uuid->string());
    if (!record) return nullptr;
    if (BTHContainerClassIsBundle(containerClass)) {
        if (BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance())
            mapping->removeCodeSigningDictionariesForIdentifierAndItsChildren(*identifier);
    }
    const std::filesystem::path& url = record->url();
    const std::filesystem::path destination =
        BTHGlobalConfiguration::sharedInstance().deathrowDirectory() / url.filename();
    BTHFileManager& fileManager = BTHFileManager::defaultManager();
    BTHErrorRef moveError;
    if (!fileManager.moveItemAtURL(url, destination, &moveError)) {
        BTHLogDebug("Couldn't stage for deletion from %@ to %@: %@", url, destination, moveError);
        BTHErrorRef removeError;
        if (!fileManager.removeItemAtURL(url, &removeError)) {
            BTHMakeError(BTHErrorDeleteFailed, removeError, "Failed to delete container at %@: %@",
                         url, removeError);
            return nullptr;
        }
    }
    if (!_setSandboxContainerMappingForUser(userId, *identifier, containerClass, std::nullopt)) {
        BTHLogError("Failed to remove container mapping in delete operation of %@, %llu",
                    identifier, containerClass);
    }
    BTHErrorRef cacheError;
    if (!cache.removeContainerForUser(userId, containerClass, *identifier, record->transient(),
                                      &cacheError)) {
        return BTHMakeError(BTHErrorCacheRemoveFailed, cacheError,
                            "Failed to remove from cache id: %@, class: %ld, transient: %d",
                            identifier, containerClass, record->transient());
    }
    return nullptr;
}

void BTHClientConnection::stageForDeleteContainersWithUsers(
    const std::vector<uid_t>& users, const std::vector<std::optional<Uuid>>& uuids,
    const std::optional<std::vector<std::optional<std::string>>>& identifiers,
    const std::vector<Value>& classes, bool useLocking, uint64_t* error) {
    BTH_FUNCTION(kStageFunction);
    const size_t identifierCount = identifiers ? identifiers->size() : 0;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
        // The users travel with the other three lists: all four must match.
        if (uuids.size() != classes.size() || uuids.size() != identifierCount ||
            users.size() != uuids.size()) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid input: UUIDString count: %ld, class "
                                "count: %ld, ID count: %ld",
                                uuids.size(), classes.size(), identifierCount);
        }
        BTHAllIdentifiersLockGuard lock(true, useLocking);
        for (size_t i = 0; i < uuids.size(); ++i) {
            if (BTHErrorRef stop =
                    stageOneForDelete(users[i], uuids[i], (*identifiers)[i], classes[i]))
                return stop;
        }
        return nullptr;
    });
    if (failure) BTHSetErrorCode(error, failure->code64());
}

void BTHClientConnection::deleteContainerForUser(uid_t userId,
                                                 const std::optional<std::string>& identifier,
                                                 uint64_t containerClass, bool transient,
                                                 uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection deleteContainerForUser:withIdentifier:containerClass:transient:"
        "withError:]");
    uint64_t result = BTHErrorSuccess;
    const BTHErrorRef failure =
        BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
            const BTHMetadataRef record = createOrLookupContainerForUser(
                userId, identifier, false, containerClass, transient, true, &result);
            if (!record) {
                BTHLogError(
                    "Failed to lookup existing container to delete-identifier: %@, class: %ld, "
                    "transient: %d",
                    identifier, containerClass, transient);
                return nullptr;
            }
            stageForDeleteContainersWithUsers(
                {record->uid()}, {record->uuid()},
                std::vector<std::optional<std::string>>{record->identifier()},
                {Value(record->containerClass())}, true, &result);
            return nullptr;
        });
    if (failure) result = failure->code64();
    BTHSetErrorCode(error, result);
}

void BTHClientConnection::deleteDataContainerContentForUser(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t containerClass,
    uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection deleteDataContainerContentForUser:identifier:containerClass:"
        "withError:]");
    uint64_t result = BTHErrorSuccess;
    const BTHErrorRef failure =
        BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
            if (!identifier) {
                BTHLogError("Can't wipe container with nil identifier: %@, userId: %u", identifier,
                            userId);
                result = BTHErrorIdentifierMissing;
                return nullptr;
            }
            if (!BTHContainerClassIsData(containerClass)) {
                BTHLogError(
                    "Can't wipe container non-data container of type: %llu, identifier: %@, "
                    "userId: %u",
                    containerClass, identifier, userId);
                result = BTHErrorInvalidArgument;
                return nullptr;
            }
            if (!allowOtherIdLookup_ && !mayWipe(*identifier, containerClass)) {
                if (containerClass == BTHContainerClassDataSprocketPlugin) {
                    BTHLogError("Not entitled to wipe container with identifier: %@", identifier);
                    result = BTHErrorNotEntitled;
                } else {
                    BTHLogError(
                        "Can't wipe container with of type: %llu, identifier: %@, userId: %u",
                        containerClass, identifier, userId);
                    result = BTHErrorInvalidArgument;
                }
                return nullptr;
            }
            const BTHMetadataRef existing = createOrLookupContainerForUser(
                userId, identifier, false, containerClass, false, true, &result);
            if (!existing) {
                BTHLogError("Failed to lookup existing container to wipe-identifier: %@",
                            identifier);
                return nullptr;
            }
            const BTHMetadataRef fresh = createOrLookupContainerForUser(
                userId, identifier, true, containerClass, true, true, &result);
            if (!fresh) {
                BTHLogError("Failed to create transient container for wipe-identifier: %@",
                            identifier);
                return nullptr;
            }
            BTHReplaceRequest replace;
            replace.oldUUID = existing->uuid();
            replace.newUUID = fresh->uuid();
            replace.oldUserId = replace.newUserId = userId;
            replace.oldIdentifier = replace.newIdentifier = identifier;
            replace.oldClass = replace.newClass = containerClass;
            replace.preserveOldUUID = true;
            replace.startDeletionThread = true;
            replaceContainer(replace, &result);
            if (result != BTHErrorSuccess)
                BTHLogError("Failed replace operation during delete all content");
            return nullptr;
        });
    if (failure) result = failure->code64();
    BTHSetErrorCode(error, result);
}

bool BTHClientConnection::mayWipe(const std::string& identifier, uint64_t containerClass) const {
    if (containerClass != BTHContainerClassDataSprocketPlugin || !entitledWipeIdentifiers_)
        return false;
    const auto& entitled = *entitledWipeIdentifiers_;
    return std::find(entitled.begin(), entitled.end(), identifier) != entitled.end();
}

}  // namespace berth
