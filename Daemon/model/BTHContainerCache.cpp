#include "BTHContainerCache.h"

#include <exception>
#include <string_view>
#include <utility>

#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

// What follows a class name when a class map is named in a message.
const char* mapSuffix(bool transient) {
    return transient ? "(transient)" : "";
}

// "%u-%@": the user id and the class name.
std::string classMapKey(uid_t userId, uint64_t containerClass) {
    std::string key = std::to_string(userId);
    key += '-';
    key += BTHContainerClassName(containerClass);
    return key;
}

// Bundle classes belong to user 33 and system classes to 499; a per-user
// class may belong to any user.
bool classAdmitsUser(uint64_t containerClass, uid_t userId) {
    if (BTHContainerClassIsGlobal(containerClass))
        return userId == BTHContainerClassGlobalUser(containerClass);
    return BTHContainerClassIsPerUser(containerClass);
}

// A record's url can name its metadata file only when it is an absolute path
// (an empty path is not).
bool isContainerURL(const std::filesystem::path& url) {
    return url.is_absolute();
}

// The exception rule at an operation's boundary: the code-40 error is made
// and logged, handed out, and the exception reported. The operation's locks
// are already released by the unwinding.
void failWithCurrentException(const char* function, int line, BTHErrorRef* error) {
    const BTHCaughtException caught = BTHCaughtException::from(std::current_exception());
    BTHSetError(error, BTHCreateExceptionError(function, line, caught));
    BTHReportCaughtException(caught);
}

}  // namespace

BTHContainerCache& BTHContainerCache::sharedInstance() {
    static BTHContainerCache instance;
    return instance;
}

BTHMetadataRef BTHContainerCache::containerForUser(uid_t userId, uint64_t containerClass,
                                                   const std::string& identifier, bool transient,
                                                   BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerCache containerForUser:contentClass:identifier:transient:error:]");
    try {
        if (!BTHContainerClassIsValid(containerClass)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid Content Class: %ld", containerClass));
            return nullptr;
        }
        const std::string_view className = BTHContainerClassName(containerClass);
        const char* suffix = mapSuffix(transient);
        BTHMetadataRef entry;
        std::filesystem::path url;
        {
            std::lock_guard lock(cacheLock_);
            ClassMap* classMap = classMapForOperation(bthFunctionName, __LINE__, userId,
                                                      containerClass, transient, error);
            if (!classMap) return nullptr;
            if (auto found = classMap->find(identifier); found != classMap->end()) {
                entry = found->second;
                url = entry->url();
            }
        }
        if (!entry) {
            // An ordinary miss: the caller decides whether it matters.
            BTHSetError(error, BTHMakeUnloggedError(BTHErrorNotFound, nullptr,
                                                    "Cache: %@%@: Container Not Found with ID: %@",
                                                    className, suffix, identifier));
            return nullptr;
        }
        if (!isContainerURL(url)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Cache: %@%@: Invalid URL path string: %@", className,
                                            suffix, url));
            return nullptr;
        }
        if (!presence_.metadataFileExists(url)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInconsistent, nullptr,
                                            "Cache: %@%@: INCONSISTENT-No Metadata at: %@",
                                            className, suffix, BTHMetadata::metadataFileURL(url)));
            return nullptr;
        }
        BTHLogDebug("Cache: %@%@: Found Identifier: %@", className, suffix, identifier);
        return entry;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, error);
        return nullptr;
    }
}

BTHMetadataRef BTHContainerCache::containerForUser(uid_t userId, uint64_t containerClass,
                                                   const std::string& identifier,
                                                   const std::string& uuidString) {
    BTH_FUNCTION("-[BTHContainerCache containerForUser:contentClass:identifier:uuidString:]");
    try {
        for (const bool transient : {false, true}) {
            BTHMetadataRef entry =
                containerForUser(userId, containerClass, identifier, transient, nullptr);
            if (!entry || entry->uuid().string() != uuidString) continue;
            std::lock_guard lock(cacheLock_);
            entry->setTransient(transient);
            return entry;
        }
        return nullptr;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, nullptr);
        return nullptr;
    }
}

std::optional<std::vector<BTHMetadataRef>> BTHContainerCache::allContainersForUser(
    uid_t userId, uint64_t containerClass, bool transient, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerCache allContainersForUser:contentClass:transient:error:]");
    try {
        if (!BTHContainerClassIsValid(containerClass)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid Content Class: %ld", containerClass));
            return std::nullopt;
        }
        const std::string_view className = BTHContainerClassName(containerClass);
        const char* suffix = mapSuffix(transient);
        // The urls are copied with the records so the disk checks below read
        // nothing that an addition could change meanwhile.
        struct Snapshot {
            BTHMetadataRef record;
            std::filesystem::path url;
        };
        std::vector<Snapshot> snapshot;
        {
            std::lock_guard lock(cacheLock_);
            ClassMap* classMap = classMapForOperation(bthFunctionName, __LINE__, userId,
                                                      containerClass, transient, error);
            if (!classMap) return std::nullopt;
            snapshot.reserve(classMap->size());
            for (const auto& [identifier, record] : *classMap)
                snapshot.push_back({record, record->url()});
        }
        if (snapshot.empty()) BTHLogDebug("Cache: %@%@: No Containers Found", className, suffix);

        std::vector<BTHMetadataRef> containers;
        containers.reserve(snapshot.size());
        for (Snapshot& item : snapshot) {
            // A bad entry is logged and left out; the listing still succeeds.
            if (!isContainerURL(item.url)) {
                BTHMakeError(BTHErrorCacheInvalidInput, nullptr, "Cache: %@%@: nil URL from %@",
                             className, suffix, item.url);
                continue;
            }
            // On disk, file by file: watching every file of a class would
            // walk each directory on the way of each file, far more than
            // these checks cost.
            const std::filesystem::path metadataFile = BTHMetadata::metadataFileURL(item.url);
            if (!BTHFileManager::defaultManager().itemExistsAtURL(metadataFile)) {
                BTHMakeError(BTHErrorCacheInconsistent, nullptr,
                             "Cache: %@%@: INCONSISTENT-No Metadata at: %@", className, suffix,
                             metadataFile);
                continue;
            }
            BTHLogDebug("Cache: %@%@: ALL Found Identifier: %@", className, suffix,
                        item.record->identifier());
            containers.push_back(std::move(item.record));
        }
        return containers;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, error);
        return std::nullopt;
    }
}

std::optional<std::vector<std::string>> BTHContainerCache::allContainerIdentifiersForUser(
    uid_t userId, uint64_t containerClass, bool transient, BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHContainerCache allContainerIdentifiersForUser:contentClass:transient:error:]");
    try {
        if (!BTHContainerClassIsValid(containerClass)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid Content Class: %ld", containerClass));
            return std::nullopt;
        }
        std::vector<std::string> identifiers;
        {
            std::lock_guard lock(cacheLock_);
            ClassMap* classMap = classMapForOperation(bthFunctionName, __LINE__, userId,
                                                      containerClass, transient, error);
            if (!classMap) return std::nullopt;
            identifiers.reserve(classMap->size());
            for (const auto& entry : *classMap) identifiers.push_back(entry.first);
        }
        if (identifiers.empty())
            BTHLogDebug("Cache: %@%@: No Identifiers Found", BTHContainerClassName(containerClass),
                        mapSuffix(transient));
        return identifiers;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, error);
        return std::nullopt;
    }
}

bool BTHContainerCache::addContainerMetadata(const BTHMetadataRef& metadata, uid_t userId,
                                             const std::filesystem::path& url, bool transient,
                                             BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerCache addContainerMetadata:forUser:url:transient:error:]");
    try {
        if (!metadata) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid metadata Identifier: %@", nullptr));
            return false;
        }
        const uint64_t containerClass = metadata->containerClass();
        if (!BTHContainerClassIsValid(containerClass)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                     "Invalid Metadata Content Class: %lld", containerClass));
            return false;
        }
        if (!isContainerURL(url)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid input: URL: %@", url));
            return false;
        }
        const std::string identifier = metadata->identifier();
        {
            std::lock_guard lock(cacheLock_);
            ClassMap* classMap = classMapForOperation(bthFunctionName, __LINE__, userId,
                                                      containerClass, transient, error);
            if (!classMap) return false;
            metadata->setUrl(url);
            classMap->insert_or_assign(identifier, metadata);
        }
        BTHLogDebug("Cache: %@%@: Added Identifier: %@", BTHContainerClassName(containerClass),
                    mapSuffix(transient), identifier);
        return true;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, error);
        return false;
    }
}

bool BTHContainerCache::removeContainerForUser(uid_t userId, uint64_t containerClass,
                                               const std::string& identifier, bool transient,
                                               BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHContainerCache removeContainerForUser:contentClass:identifier:transient:error:]");
    try {
        if (!BTHContainerClassIsValid(containerClass)) {
            BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                            "Invalid Content Class: %ld", containerClass));
            return false;
        }
        {
            std::lock_guard lock(cacheLock_);
            ClassMap* classMap = classMapForOperation(bthFunctionName, __LINE__, userId,
                                                      containerClass, transient, error);
            if (!classMap) return false;
            classMap->erase(identifier);
        }
        BTHLogDebug("Cache: %@%@: Removed Identifier: %@", BTHContainerClassName(containerClass),
                    mapSuffix(transient), identifier);
        return true;
    } catch (...) {
        failWithCurrentException(bthFunctionName, __LINE__, error);
        return false;
    }
}

BTHMetadataRef BTHContainerCache::snapshotOf(const BTHMetadata& record) {
    std::lock_guard lock(cacheLock_);
    return std::make_shared<BTHMetadata>(record);
}

void BTHContainerCache::resetForTesting() {
    std::lock_guard lock(cacheLock_);
    liveContainerCache_.clear();
    transientContainerCache_.clear();
    presence_.reset();
}

BTHContainerCache::ClassMap* BTHContainerCache::getCacheForUserId(uid_t userId,
                                                                  uint64_t containerClass,
                                                                  bool transient,
                                                                  BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerCache _getCacheForUserId:contentClass:transient:error:]");
    if (!classAdmitsUser(containerClass, userId)) {
        BTHSetError(error, BTHMakeError(BTHErrorCacheInvalidInput, nullptr,
                                        "Invalid cache get-userId %u for class %ld", userId,
                                        containerClass));
        return nullptr;
    }
    std::map<std::string, ClassMap>& caches =
        transient ? transientContainerCache_ : liveContainerCache_;
    std::string key = classMapKey(userId, containerClass);
    if (auto found = caches.find(key); found != caches.end()) return &found->second;

    BTHLogDebug("Rebuilding container class cache: %@%@", key, mapSuffix(transient));
    std::optional<ClassMap> built = buildClassMap(userId, containerClass, transient, error);
    if (!built) return nullptr;
    return &caches.emplace(std::move(key), std::move(*built)).first->second;
}

BTHContainerCache::ClassMap* BTHContainerCache::classMapForOperation(const char* function, int line,
                                                                     uid_t userId,
                                                                     uint64_t containerClass,
                                                                     bool transient,
                                                                     BTHErrorRef* error) {
    BTHErrorRef cause;
    ClassMap* classMap = getCacheForUserId(userId, containerClass, transient, &cause);
    if (classMap) return classMap;
    if (cause && cause->isBTHError(BTHErrorCacheInvalidInput)) {
        BTHSetError(error, std::move(cause));
        return nullptr;
    }
    BTHSetError(
        error, BTHCreateError(function, line, kBTHErrorDomain, BTHErrorCacheRebuildFailed,
                              std::move(cause), nullptr, 1, "Cache: %u-%@%@: Failed to rebuild",
                              userId, BTHContainerClassName(containerClass), mapSuffix(transient)));
    return nullptr;
}

std::optional<BTHContainerCache::ClassMap> BTHContainerCache::buildClassMap(uid_t userId,
                                                                            uint64_t containerClass,
                                                                            bool transient,
                                                                            BTHErrorRef* error) {
    // Creates the class directory when it is missing, so a fresh class gives
    // an empty map rather than a failure.
    const std::optional<std::filesystem::path> directory =
        BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            userId, containerClass, transient);
    // A user without a home has no class directory: no listing, no error
    // beyond the caller's own.
    if (!directory) return std::nullopt;
    std::optional<std::vector<BTHFileURL>> items =
        BTHFileManager::defaultManager().urlsForItemsInDirectoryAtURL(*directory, error);
    if (!items) return std::nullopt;

    ClassMap classMap;
    for (BTHFileURL& item : *items) {
        // Everything made for one item (its path, a record that does not
        // validate) is freed before the next is read; only the map grows.
        const std::filesystem::path url = std::move(item.path);
        BTHMetadataRef record = BTHMetadata::readAndValidateMetadataAtUrl(
            url, userId, /*checkClassPath=*/true, nullptr);
        if (!record) continue;  // not a container of this class; the read logged why
        record->setTransient(transient);
        std::string identifier = record->identifier();
        classMap.insert_or_assign(std::move(identifier), std::move(record));
    }
    return classMap;
}

}  // namespace berth
