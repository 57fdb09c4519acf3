// Creating and finding containers: the one way a container comes into being.
// A container is built in the private staging directory under a fresh name,
// given its metadata file, access control list and subdirectories there, and
// only then moved into its live place with one rename, so look-ups never see
// a half-built container and a crash leaves at most a staging leftover that
// the next start sends to death row.
//
// An answer is durable: the staged tree is synced before the rename, and the
// caller waits for a sync of the class directory that started after the
// rename (shared with concurrent creations, BTHDirectorySync) before it
// returns. A look-up that finds a container waits the same way, since what
// it found may be a concurrent creation whose sync is still running.
#include <fcntl.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstring>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHDirectorySync.h"
#include "BTHFaultInjection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLocks.h"
#include "BTHLog.h"
#include "BTHWhitelist.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"
#include "platform/SafeFs.h"
#include "platform/SandboxMappingStore.h"
#include "platform/SyncTogether.h"

namespace berth {

namespace {

constexpr const char* kCreateFunction =
    "-[BTHClientConnection "
    "createOrLookupContainerForUser:identifier:createIfNecessary:containerClass:transient:"
    "useLocking:withError:]";

// Who owns a new container's directories and what its subdirectories are.
struct ContainerLayout {
    uid_t topOwner;  // 0: left as created (root)
    std::vector<const char*> subdirectories;
    mode_t subdirectoryMode;
    uid_t subdirectoryOwner;
};

ContainerLayout layoutFor(uint64_t containerClass, uid_t userId) {
    static const std::vector<const char*> kDataDirectories = {
        "Documents", "Library", "Library/Caches", "Library/Preferences", "tmp"};
    static const std::vector<const char*> kGroupDirectories = {"Library", "Library/Caches"};
    // System containers: the subdirectories' owner and other bits stay empty;
    // the group bits carry the mask of the "systemusers" entry they inherit
    // from the top directory's access control list.
    constexpr mode_t kSystemMode = 0070;
    switch (containerClass) {
        case BTHContainerClassDataSystem:
            return {0, kDataDirectories, kSystemMode, kBTHNobodyUserId};
        case BTHContainerClassSharedSystemGroup:
            return {0, kGroupDirectories, kSystemMode, kBTHNobodyUserId};
        case BTHContainerClassSharedAppGroup:
            return {userId, kGroupDirectories, 0755, userId};
        default:
            if (BTHContainerClassIsBundle(containerClass)) return {kBTHBundleUserId, {}, 0, 0};
            return {userId, kDataDirectories, 0755, userId};
    }
}

// The sandbox's item type for a class, and the user its record is kept for.
struct SandboxItem {
    bool recorded;
    uid_t user;
    uint64_t itemType;
};

std::optional<SandboxItem> sandboxItemFor(uint64_t containerClass, uid_t userId) {
    if (BTHContainerClassIsBundle(containerClass)) return SandboxItem{false, 0, 0};
    switch (containerClass) {
        case BTHContainerClassSharedAppGroup:
            return SandboxItem{true, userId, 2};
        case BTHContainerClassDataSystem:
            return SandboxItem{true, 0, 4};
        case BTHContainerClassSharedSystemGroup:
            return SandboxItem{true, 0, 8};
        default:
            if (BTHContainerClassIsPerUser(containerClass)) return SandboxItem{true, userId, 1};
            return std::nullopt;
    }
}

bool userIsValidForClass(uid_t userId, uint64_t containerClass) {
    if (!BTHContainerClassIsValid(containerClass)) return false;
    if (BTHContainerClassIsGlobal(containerClass))
        return userId == BTHContainerClassGlobalUser(containerClass);
    return true;
}

}  // namespace

bool BTHClientConnection::_createDefaultDirectory(const std::filesystem::path& url, mode_t mode,
                                                  uid_t owner, BTHErrorRef* error) {
    return BTHFileManager::defaultManager().createDirectoryAtURL(url, true, mode, owner, error);
}

bool BTHClientConnection::_createTopLevelContainerDirectory(const std::filesystem::path& url,
                                                            uint64_t containerClass, uid_t owner,
                                                            BTHErrorRef* error) {
    const uid_t topOwner = layoutFor(containerClass, owner).topOwner;
    return BTHFileManager::defaultManager().createDirectoryAtURL(url, true, 0755, topOwner, 0,
                                                                 error);
}

bool BTHClientConnection::_createSubDirectories(const std::filesystem::path& url, uid_t userId,
                                                uint64_t containerClass, BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHClientConnection _createSubDirectories:userId:containerClass:error:]");
    const ContainerLayout layout = layoutFor(containerClass, userId);
    for (const char* name : layout.subdirectories) {
        BTHErrorRef createError;
        if (!_createDefaultDirectory(url / name, layout.subdirectoryMode, layout.subdirectoryOwner,
                                     &createError)) {
            BTHSetError(error, BTHMakeError(BTHErrorDirectorySetupFailed, createError,
                                            "Failed to create sub-dir at %@%@", url, name));
            return false;
        }
    }
    return true;
}

bool BTHClientConnection::_setSandboxContainerMappingForUser(
    uid_t userId, const std::string& identifier, uint64_t containerClass,
    const std::optional<std::filesystem::path>& url) {
    BTH_FUNCTION(
        "-[BTHClientConnection _setSandboxContainerMappingForUser:identifier:containerClass:url:]");
    const std::optional<SandboxItem> item = sandboxItemFor(containerClass, userId);
    if (!item) {
        BTHLogError("Unsupported class for setting sandbox container mapping: %llu",
                    containerClass);
        return false;
    }
    if (!item->recorded) return true;
    const std::string path = url ? url->string() : std::string("(null)");
    SandboxMappingStore& store = SandboxMappingStore::shared();
    int result = store.setUserStateItem(item->user, item->itemType, identifier, std::nullopt);
    if (result != 0) {
        BTHLogError(
            "Failed to remove mapping for user: %u, itemType: %llu, identifier: %s, class: %llu, "
            "path: %s : %d",
            item->user, item->itemType, identifier, containerClass, path, result);
        return false;
    }
    if (!url) return true;
    result = store.setUserStateItem(item->user, item->itemType, identifier, url->string());
    if (result != 0) {
        BTHLogError(
            "Failed to set mapping for user: %u, itemType: %llu, identifier %s, class: %llu, "
            "path: %s : %d",
            item->user, item->itemType, identifier, containerClass, path, result);
        return false;
    }
    return true;
}

namespace {

// The steps of one create-or-look-up call, with the staging directory they
// may leave behind. The caller runs lookUp() and commit() under the
// all-identifiers lock; stage() and waitUntilDurable() need no lock.
class CreateOrLookup {
  public:
    CreateOrLookup(BTHClientConnection& client, uid_t userId, const std::string& identifier,
                   uint64_t containerClass, bool transient)
        : client_(client),
          userId_(userId),
          identifier_(identifier),
          containerClass_(containerClass),
          transient_(transient),
          classDirectory_(BTHGlobalConfiguration::sharedInstance().containerDirectoryPathForUser(
              userId, containerClass, transient)) {}

    enum class Found { kNone, kContainer, kFailure };

    bool transient() const { return transient_; }

    // Step 6. kContainer: the permanent container in `*result`; kFailure:
    // the look-up failed with anything but "not found" (or a transient
    // container could not be retired); kNone: there is none (any transient
    // one is retired).
    Found lookUp(BTHMetadataRef* result, BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        BTHContainerCache& cache = BTHContainerCache::sharedInstance();
        BTHErrorRef cacheError;
        BTHMetadataRef found =
            cache.containerForUser(userId_, containerClass_, identifier_, transient_, &cacheError);
        if (!found) {
            if (cacheError && cacheError->isBTHError(BTHErrorNotFound)) return Found::kNone;
            BTHSetError(error, cacheError);
            return Found::kFailure;
        }
        if (!transient_) {
            // The caller gets a snapshot: the cached record may change once
            // the lock is released.
            *result = cache.snapshotOf(*found);
            (*result)->setExisted(true);
            // The container may be another call's creation whose rename is
            // not durable yet: the caller waits for it before answering.
            if (classDirectory_)
                change_ = BTHDirectorySync::sharedInstance().lastChange(*classDirectory_);
            return Found::kContainer;
        }
        BTHErrorRef deathRowError;
        if (!client_._moveItemAtURLToDeathRow(found->url(), true, true, &deathRowError)) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorRemoveTransientFailed, deathRowError,
                                     "Failed to remove transient container at %@", found->url()));
            return Found::kFailure;
        }
        // The retired container leaves the cache too: a look-up that does
        // not create must not leave behind an entry whose directory is gone.
        cache.removeContainerForUser(userId_, containerClass_, identifier_, true, nullptr);
        return Found::kNone;
    }

    // Step 7: the error of a look-up that may not create.
    BTHErrorRef notFound() const {
        BTH_FUNCTION(kCreateFunction);
        return BTHMakeUnloggedError(BTHErrorNotFound, nullptr,
                                    "Container with identifier: \"%@\" Not Found", identifier_);
    }

    // Steps 8 to 12: the whole container in a staging directory of its own,
    // durable there, so the rename into place is the last change it needs.
    bool stage(BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        // Only a container about to be made needs its class directory in
        // place: made here, with its parents, when missing (a failure shows
        // when the staged container cannot be moved into it).
        BTHGlobalConfiguration::sharedInstance().containerDirectoryURLForUser(
            userId_, containerClass_, transient_);
        directoryName_ = Uuid::random().string();
        const std::filesystem::path staging =
            BTHGlobalConfiguration::sharedInstance().stagingDirectory() / directoryName_;
        stagingURL_ = staging;

        BTHErrorRef stepError;
        if (!client_._createTopLevelContainerDirectory(staging, containerClass_, userId_,
                                                       &stepError)) {
            BTHSetError(
                error, BTHMakeError(BTHErrorCreateStagingFailed, stepError,
                                    "Failed to create staging dir at %@ : %@", staging, stepError));
            return false;
        }
        record_ = std::make_shared<BTHMetadata>(userId_, Uuid::random(), containerClass_,
                                                identifier_, std::nullopt, staging, std::nullopt);
        if (!record_->writeStagedMetadataToDisk(error)) return false;
        if (BTHContainerClassIsSystem(containerClass_) &&
            !BTHFileManager::defaultManager().setTopLevelSystemContainerACLAtURL(staging, error))
            return false;
        if (!client_._createSubDirectories(staging, userId_, containerClass_, error)) return false;
        if (!syncStaged(staging, error)) return false;
        BTHCrashPoint("create.staged");
        return true;
    }

    // Steps 13 to 18: the staged container moves into place and into the
    // cache. Its rename is noted for waitUntilDurable().
    BTHMetadataRef commit(BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        const std::filesystem::path staging = *stagingURL_;
        const std::filesystem::path live =
            (classDirectory_ ? *classDirectory_ : std::filesystem::path()) / liveName();
        BTHErrorRef stepError;
        if (!classDirectory_ ||
            !BTHFileManager::defaultManager().moveItemAtURL(staging, live, &stepError)) {
            BTHSetError(error, BTHMakeError(BTHErrorMoveStagingFailed, stepError,
                                            "Failed to move staging dir: %@ to live dir: %@",
                                            staging, live));
            return nullptr;
        }
        change_ = BTHDirectorySync::sharedInstance().noteChange(*classDirectory_);
        stagingURL_.reset();
        record_->setUrl(live);
        record_->setExisted(false);
        record_->setTransient(transient_);
        return addToCache(live, error);
    }

    // What the reply promises: the container's entry in its class directory
    // (the one the caller found, or the one commit() made) survives a crash.
    bool waitUntilDurable(const BTHMetadataRef& result, BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        if (!classDirectory_ || change_ == 0) return true;
        BTHErrorRef syncError;
        if (BTHDirectorySync::sharedInstance().waitUntilDurable(*classDirectory_, change_,
                                                                &syncError))
            return true;
        BTHSetError(error, BTHMakeError(BTHErrorWriteFailed, syncError,
                                        "Failed to sync directory %@ holding %@", *classDirectory_,
                                        result->url()));
        return false;
    }

    // Step 19.1: a staging directory still pending goes to death row.
    void cleanUp(BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        if (!stagingURL_) return;
        BTHErrorRef deathRowError;
        if (!client_._moveItemAtURLToDeathRow(*stagingURL_, true, true, &deathRowError)) {
            BTHSetError(error, BTHMakeError(BTHErrorRemoveStagingFailed, deathRowError,
                                            "Failed to remove staging dir: %@", *stagingURL_));
        }
        stagingURL_.reset();
    }

  private:
    // The staged tree reaches the disk: the metadata file's contents, the
    // entries of "Library" and of the container directory (metadata file,
    // subdirectories) and the directory's access control list and owner. The
    // metadata file is written without a sync of its own: on a journalling
    // file system the first sync here commits the whole tree at once.
    bool syncStaged(const std::filesystem::path& staging, BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        const int err = BTHFaultActive("create.sync-staged") ? EIO : syncStagedItems(staging);
        if (err == 0) return true;
        BTHSetError(
            error,
            BTHMakeError(BTHErrorWriteFailed,
                         BTHMakePOSIXError(err, "fsync of %s failed: %s", staging, strerror(err)),
                         "Failed to sync directory %@ holding %@", staging, staging));
        return false;
    }

    // The metadata file, "Library" (when the class has one) and the
    // container directory, synced together: one journal commit for all.
    static int syncStagedItems(const std::filesystem::path& staging) {
        std::vector<UniqueFd> items;
        items.push_back(fs::openNoFollow(BTHMetadata::metadataFileURL(staging), O_RDONLY));
        if (!items.back()) return errno;
        UniqueFd library = fs::openNoFollow(staging / "Library", O_RDONLY | O_DIRECTORY);
        if (library)
            items.push_back(std::move(library));
        else if (errno != ENOENT)
            return errno;
        items.push_back(fs::openNoFollow(staging, O_RDONLY | O_DIRECTORY));
        if (!items.back()) return errno;
        std::vector<int> fds;
        for (const UniqueFd& item : items) fds.push_back(item.get());
        return syncTogether(fds);
    }

    // Step 14: well-known system containers live under their fixed name.
    std::string liveName() const {
        const BTHWhitelist& whitelist = BTHWhitelist::sharedWhitelist();
        std::optional<std::string> wellKnown;
        if (containerClass_ == BTHContainerClassDataSystem)
            wellKnown = whitelist.wellknownSystemContainerForId(identifier_);
        else if (containerClass_ == BTHContainerClassSharedSystemGroup)
            wellKnown = whitelist.wellknownSystemGroupContainerForId(identifier_);
        return wellKnown ? *wellKnown : directoryName_;
    }

    // Step 17. The live directory stays even when the cache refuses it.
    BTHMetadataRef addToCache(const std::filesystem::path& live, BTHErrorRef* error) {
        BTH_FUNCTION(kCreateFunction);
        BTHErrorRef cacheError;
        bool added = false;
        if (BTHFaultActive("create.cache-add")) {
            cacheError = BTHMakeUnloggedError(BTHErrorCacheInvalidInput, nullptr,
                                              "Invalid input: URL: %@", live);
        } else {
            added = BTHContainerCache::sharedInstance().addContainerMetadata(
                record_, userId_, live, transient_, &cacheError);
        }
        if (!added) {
            BTHSetError(error,
                        BTHMakeError(BTHErrorCacheAddFailed, cacheError,
                                     "Failed to add to cache for %u : %@, url: %@, transient: %d",
                                     userId_, record_, live, transient_));
            return nullptr;
        }
        return std::make_shared<BTHMetadata>(*record_);
    }

    BTHClientConnection& client_;
    const uid_t userId_;
    const std::string identifier_;
    const uint64_t containerClass_;
    const bool transient_;
    const std::optional<std::filesystem::path> classDirectory_;
    std::string directoryName_;
    std::optional<std::filesystem::path> stagingURL_;
    BTHMetadataRef record_;
    uint64_t change_ = 0;  // the class directory's change the reply waits for
};

// Runs one create or look-up. With `useLocking`, the all-identifiers lock is
// held for the look-up (for reading, unless a transient container may have
// to be retired) and, when a container must be made, again, for writing, for
// the second look-up and the rename; the container is staged between the two,
// so concurrent creations build and sync their trees in parallel and only
// check-and-rename one at a time. The second look-up keeps creation of one
// identifier serialised: a concurrent call that got there first wins and its
// container is the answer; the loser's staging goes to death row. Without
// `useLocking` the caller holds the lock throughout.
BTHMetadataRef createOrLookup(CreateOrLookup& operation, bool createIfNecessary, bool useLocking,
                              BTHErrorRef* error) {
    using Found = CreateOrLookup::Found;
    BTHMetadataRef result;
    Found found;
    {
        // Finding a permanent container changes nothing, so concurrent
        // look-ups share the lock; only retiring a transient container, or
        // making one, excludes everyone else.
        BTHAllIdentifiersLockGuard lock(operation.transient(), useLocking);
        found = operation.lookUp(&result, error);
        if (found == Found::kFailure) return nullptr;
        if (found == Found::kNone && !createIfNecessary) {
            BTHSetError(error, operation.notFound());
            return nullptr;
        }
        if (found == Found::kNone && !useLocking)
            result = operation.stage(error) ? operation.commit(error) : nullptr;
    }
    if (found == Found::kNone && useLocking) {
        if (!operation.stage(error)) return nullptr;
        BTHAllIdentifiersLockGuard lock(true);
        found = operation.lookUp(&result, error);
        if (found == Found::kNone) result = operation.commit(error);
    }
    if (!result || !operation.waitUntilDurable(result, error)) return nullptr;
    return result;
}

}  // namespace

BTHErrorRef BTHClientConnection::checkCreateOrLookupRequest(
    uid_t userId, const std::optional<std::string>& identifier, uint64_t containerClass) {
    BTH_FUNCTION(kCreateFunction);
    if (!identifier || !BTHContainerClassIsValid(containerClass)) {
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Can't act on an invalid object: userId: %u, ID: %@, class: %ld",
                            userId, identifier, containerClass);
    }
    if (!userIsValidForClass(userId, containerClass)) {
        return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                            "Invalid userId %u for class %ld, ID: %@", userId, containerClass,
                            identifier);
    }
    const bool ownIdentifier = clientBundleIdentifier_ == identifier;
    const bool groupClass = containerClass == BTHContainerClassSharedAppGroup ||
                            containerClass == BTHContainerClassSharedSystemGroup;
    if (!ownIdentifier && !allowOtherIdLookup_ && !(groupClass && allowGroupIdLookup_) &&
        DeviceProperties::isInternalBuild()) {
        BTHLogWarning(
            "%@ trying to retrieve container class %ld for identifier: %@. WARNING: Soon you will "
            "need an entitlement to do this. File a Snag in \"Berth | all\"",
            clientBundleIdentifier_, containerClass, identifier);
    }
    if (containerClass == BTHContainerClassDataSystem && !allowOtherIdLookup_) {
        BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance();
        if (!ownIdentifier || !mapping || !mapping->identifierHasSystemContainer(*identifier)) {
            return BTHMakeError(BTHErrorNotEntitled, nullptr,
                                "%@ not entitled for system container with identifier %@",
                                clientBundleIdentifier_, identifier);
        }
    }
    return nullptr;
}

BTHMetadataRef BTHClientConnection::createOrLookupContainerForUser(
    uid_t userId, const std::optional<std::string>& identifier, bool createIfNecessary,
    uint64_t containerClass, bool transient, bool useLocking, uint64_t* error) {
    BTH_FUNCTION(kCreateFunction);
    std::optional<CreateOrLookup> operation;
    BTHMetadataRef result;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() {
        BTHErrorRef error = checkCreateOrLookupRequest(userId, identifier, containerClass);
        if (error) return error;
        operation.emplace(*this, userId, *identifier, containerClass, transient);
        result = createOrLookup(*operation, createIfNecessary, useLocking, &error);
        return error;
    });
    if (failure) result = nullptr;
    if (operation) {
        // A staging directory is still pending after a failure, or after a
        // concurrent creation of the same identifier won; only the former
        // fails the call.
        BTHErrorRef cleanUpError;
        operation->cleanUp(&cleanUpError);
        if (!result && cleanUpError) failure = cleanUpError;
    }
    if (failure || !result) {
        BTHSetErrorCode(error, failure ? failure->code64() : uint64_t{BTHErrorNotFound});
        return nullptr;
    }
    return result;
}

}  // namespace berth
