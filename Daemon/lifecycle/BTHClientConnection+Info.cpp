// Listing containers, reading their metadata and reading and changing their
// info values: the operations that address one existing container by user,
// class, identifier and UUID, under that container's identifier lock.
#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

enum class LockMode { none, reading, writing };

// Runs `work` on the container named by (user, class, identifier, UUID)
// under the container's identifier lock in `mode`: the argument checks, the
// look-up and the exception rule shared by the single-container operations.
// `checkKey`, when given, runs after the argument check and before the lock.
template <class Work>
void withContainer(const char* bthFunctionName, uid_t userId, const std::optional<Uuid>& uuid,
                   const std::optional<std::string>& identifier, uint64_t containerClass,
                   LockMode mode, uint64_t* error, const std::function<BTHErrorRef()>& checkKey,
                   Work&& work) {
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!uuid || !BTHContainerClassIsValid(containerClass)) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid object: userId: %u, UUID: %@, Class: %ld",
                                userId, uuid, containerClass);
        }
        if (checkKey) {
            if (BTHErrorRef refused = checkKey()) return refused;
        }
        const std::string uuidString = uuid->string();
        BTHIdentifierLockGuard lock(uuidString, mode == LockMode::writing, mode != LockMode::none);
        BTHMetadataRef record = identifier ? BTHContainerCache::sharedInstance().containerForUser(
                                                 userId, containerClass, *identifier, uuidString)
                                           : nullptr;
        if (!record) {
            return BTHMakeError(BTHErrorNotFound, nullptr,
                                "No Container with userId: %u UUID: %@, identifier: %@, Class: %ld",
                                userId, uuidString, identifier, containerClass);
        }
        return BTHErrorRef(work(record));
    });
    if (failure) BTHSetErrorCode(error, failure->code64());
}

LockMode lockModeFor(bool useLocking, LockMode mode) {
    return useLocking ? mode : LockMode::none;
}

}  // namespace

std::optional<std::vector<BTHMetadataRef>> BTHClientConnection::containersForUser(
    uid_t userId, uint64_t containerClass, bool transient, uint64_t* error) {
    BTH_FUNCTION("-[BTHClientConnection containersForUser:withClass:transient:withError:]");
    std::optional<std::vector<BTHMetadataRef>> containers;
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!BTHContainerClassIsValid(containerClass)) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on an invalid container-userId: %u, class: %ld", userId,
                                containerClass);
        }
        BTHAllIdentifiersLockGuard lock(false);
        BTHErrorRef cacheError;
        containers = BTHContainerCache::sharedInstance().allContainersForUser(
            userId, containerClass, transient, &cacheError);
        return cacheError;
    });
    if (failure) containers.reset();
    if (!containers) {
        BTHSetErrorCode(error, failure ? failure->code64() : uint64_t{BTHErrorNotFound});
    }
    return containers;
}

void BTHClientConnection::setInfoValue(const std::optional<Value>& value,
                                       const std::optional<std::string>& key, uid_t userId,
                                       const std::optional<Uuid>& uuid,
                                       const std::optional<std::string>& identifier,
                                       uint64_t containerClass, bool useLocking, uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection "
        "setInfoValue:forKey:userId:uuid:identifier:containerClass:useLocking:withError:]");
    auto checkKey = [&]() -> BTHErrorRef {
        if (key) return nullptr;
        return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                            "Can't set nil or non-KelpString key: %@", key);
    };
    withContainer(bthFunctionName, userId, uuid, identifier, containerClass,
                  lockModeFor(useLocking, LockMode::writing), error, checkKey,
                  [&](const BTHMetadataRef& record) -> BTHErrorRef {
                      const std::optional<Value> previous = record->info();
                      Value info = previous ? *previous : Value::dictionary();
                      if (value)
                          info.set(*key, *value);
                      else
                          info.erase(*key);
                      record->setInfo(std::move(info));
                      BTHErrorRef writeError;
                      if (!record->writeMetadataToDisk(&writeError)) {
                          // The cached record must keep saying what the file
                          // says.
                          record->setInfo(previous);
                          return writeError;
                      }
                      BTHErrorRef cacheError;
                      if (!BTHContainerCache::sharedInstance().addContainerMetadata(
                              record, userId, record->url(), record->transient(), &cacheError)) {
                          return BTHMakeError(BTHErrorCacheAddFailed, cacheError,
                                              "Failed to add to cache: %@, url: %@, transient: %d",
                                              record, record->url(), record->transient());
                      }
                      return nullptr;
                  });
}

std::optional<Value> BTHClientConnection::infoValueForKey(
    const std::optional<std::string>& key, uid_t userId, const std::optional<Uuid>& uuid,
    const std::optional<std::string>& identifier, uint64_t containerClass, bool useLocking,
    uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection "
        "infoValueForKey:userId:uuid:identifier:containerClass:useLocking:withError:]");
    auto checkKey = [&]() -> BTHErrorRef {
        if (key) return nullptr;
        return BTHMakeError(BTHErrorInvalidParameter, nullptr,
                            "Can't get nil or non-KelpString key: %@", key);
    };
    std::optional<Value> result;
    withContainer(bthFunctionName, userId, uuid, identifier, containerClass,
                  lockModeFor(useLocking, LockMode::reading), error, checkKey,
                  [&](const BTHMetadataRef& record) -> BTHErrorRef {
                      const Value* found = record->info() ? record->info()->find(*key) : nullptr;
                      if (!found) {
                          return BTHMakeUnloggedError(BTHErrorInfoValueNotFound, nullptr,
                                                      "Didn't find info value for key: %@", key);
                      }
                      result = *found;
                      return nullptr;
                  });
    return result;
}

BTHMetadataRef BTHClientConnection::metadataForUser(uid_t userId, const std::optional<Uuid>& uuid,
                                                    const std::optional<std::string>& identifier,
                                                    uint64_t containerClass, uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection metadataForUser:withUUID:identifier:containerClass:withError:]");
    BTHMetadataRef result;
    withContainer(bthFunctionName, userId, uuid, identifier, containerClass, LockMode::reading,
                  error, nullptr, [&](const BTHMetadataRef& record) -> BTHErrorRef {
                      // A snapshot: the cached record may change once the
                      // lock is released.
                      result = std::make_shared<BTHMetadata>(*record);
                      return nullptr;
                  });
    return result;
}

void BTHClientConnection::recreateDefaultStructureForUser(
    uid_t userId, const std::optional<Uuid>& uuid, const std::optional<std::string>& identifier,
    uint64_t containerClass, uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection "
        "recreateDefaultStructureForUser:withUUID:identifier:containerClass:withError:]");
    withContainer(bthFunctionName, userId, uuid, identifier, containerClass, LockMode::writing,
                  error, nullptr, [&](const BTHMetadataRef& record) -> BTHErrorRef {
                      BTHErrorRef failure;
                      if (!_createSubDirectories(record->url(), userId, containerClass, &failure))
                          return failure;
                      if (BTHContainerClassIsSystem(containerClass) &&
                          !BTHFileManager::defaultManager().standardizeACLsForSystemContainerAtURL(
                              record->url(), &failure))
                          return failure;
                      return nullptr;
                  });
}

}  // namespace berth
