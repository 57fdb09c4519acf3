// BTHClientConnection: the caller of one request, with its identity and
// rights. One is made per request (or held by the completion of an
// asynchronous command until it has replied); the daemon's own instance,
// sharedClientConnection(), does start-up and maintenance work.
//
// The container operations of this class are added by the modules that
// implement them (BTHClientConnection+Create.cpp, ...).
#pragma once

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <filesystem>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "BTHError.h"
#include "BTHMetadata.h"
#include "core/Uuid.h"
#include "core/Value.h"

namespace berth {

using BTHMetadataRef = std::shared_ptr<BTHMetadata>;

// The two containers of a replace. Without `oldUUID` there is no old
// container and the new one goes to a permanent place.
struct BTHReplaceRequest {
    std::optional<Uuid> oldUUID;
    std::optional<Uuid> newUUID;
    uid_t oldUserId = 0;
    uid_t newUserId = 0;
    std::optional<std::string> oldIdentifier;
    std::optional<std::string> newIdentifier;
    uint64_t oldClass = 0;
    uint64_t newClass = 0;
    // The new contents take the old container's place and UUID.
    bool preserveOldUUID = false;
    bool startDeletionThread = false;
};

// What a replace journal records: where the old container was, where the new
// one was, the staging directory that receives the old one, and where the
// new one goes.
struct BTHReplaceJournal {
    std::filesystem::path oldURL;
    std::filesystem::path newURL;
    std::filesystem::path stagingURL;
    std::filesystem::path destinationURL;
    std::string description() const;
};

inline constexpr const char* kBTHInternalClientIdentifier = "sys.kelp.berthd.internal";

class BTHClientConnection {
  public:
    // For requests: `allowGroupIdLookup` starts false.
    BTHClientConnection(std::optional<std::string> bundleId, uid_t clientUserId,
                        bool allowOtherIdLookup,
                        std::optional<std::vector<std::string>> entitledWipeIdentifiers);
    // For the daemon itself: user 0, no wipe identifiers.
    BTHClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup);

    // The daemon's own client object ("sys.kelp.berthd.internal", may look
    // up every identifier), made once.
    static const std::shared_ptr<BTHClientConnection>& sharedClientConnection();

    // The caller's code-signing identifier; none when it could not be had.
    const std::optional<std::string>& clientBundleIdentifier() const {
        return clientBundleIdentifier_;
    }
    uid_t clientUserId() const { return clientUserId_; }
    // The daemon's own object gains these rights while requests run on it
    // (the upcall sets them), so they are read and set atomically.
    bool allowOtherIdLookup() const { return allowOtherIdLookup_.load(std::memory_order_relaxed); }
    void setAllowOtherIdLookup(bool allow) {
        allowOtherIdLookup_.store(allow, std::memory_order_relaxed);
    }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_.load(std::memory_order_relaxed); }
    void setAllowGroupIdLookup(bool allow) {
        allowGroupIdLookup_.store(allow, std::memory_order_relaxed);
    }
    const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const {
        return entitledWipeIdentifiers_;
    }

    std::string description() const;

    // ----- Creating and finding containers (BTHClientConnection+Create.cpp)

    // The container of `identifier` for (user, class, transient): found in
    // the cache (existed true), or, with `createIfNecessary`, built under a
    // fresh directory name in the staging directory and moved into its live
    // place by one rename (existed false). A transient container is never
    // reused: a found one goes to death row and a new one is made. Nothing is
    // left in staging on any path: leftovers go to death row. With
    // `useLocking` it holds the all-identifiers lock for writing to look up
    // and to rename into place, not while it builds in staging. What it
    // returns survives a crash: the container's tree and its entry in the
    // class directory are on disk. On failure returns null and stores the
    // code through `error`.
    BTHMetadataRef createOrLookupContainerForUser(uid_t userId,
                                                  const std::optional<std::string>& identifier,
                                                  bool createIfNecessary, uint64_t containerClass,
                                                  bool transient, bool useLocking, uint64_t* error);

    // Creates a container's top directory (with parents): mode 0755,
    // protection class 0, owned by `owner` unless `owner` is 0.
    bool _createTopLevelContainerDirectory(const std::filesystem::path& url,
                                           uint64_t containerClass, uid_t owner,
                                           BTHErrorRef* error);
    bool _createDefaultDirectory(const std::filesystem::path& url, mode_t mode, uid_t owner,
                                 BTHErrorRef* error);
    // The class's default subdirectories ("Documents", "Library", ...), each
    // kept if present; error 6 at the first that cannot be made.
    bool _createSubDirectories(const std::filesystem::path& url, uid_t userId,
                               uint64_t containerClass, BTHErrorRef* error);
    // Records `url` as the sandbox's container of (user, identifier, class),
    // or removes the record when `url` is none. Bundle classes have no
    // record and succeed at once.
    bool _setSandboxContainerMappingForUser(uid_t userId, const std::string& identifier,
                                            uint64_t containerClass,
                                            const std::optional<std::filesystem::path>& url);

    // ----- Listing, metadata and info values (BTHClientConnection+Info.cpp)

    // Every container of (user, class, transient), under the all-identifiers
    // lock held for reading.
    std::optional<std::vector<BTHMetadataRef>> containersForUser(uid_t userId,
                                                                 uint64_t containerClass,
                                                                 bool transient, uint64_t* error);
    // Sets (or, with no value, removes) one info value of the container and
    // rewrites its metadata file, under its identifier lock for writing.
    void setInfoValue(const std::optional<Value>& value, const std::optional<std::string>& key,
                      uid_t userId, const std::optional<Uuid>& uuid,
                      const std::optional<std::string>& identifier, uint64_t containerClass,
                      bool useLocking, uint64_t* error);
    std::optional<Value> infoValueForKey(const std::optional<std::string>& key, uid_t userId,
                                         const std::optional<Uuid>& uuid,
                                         const std::optional<std::string>& identifier,
                                         uint64_t containerClass, bool useLocking, uint64_t* error);
    BTHMetadataRef metadataForUser(uid_t userId, const std::optional<Uuid>& uuid,
                                   const std::optional<std::string>& identifier,
                                   uint64_t containerClass, uint64_t* error);
    // Makes the class's missing default subdirectories again (existing ones
    // and their contents are kept); system containers then get their access
    // control lists standardized.
    void recreateDefaultStructureForUser(uid_t userId, const std::optional<Uuid>& uuid,
                                         const std::optional<std::string>& identifier,
                                         uint64_t containerClass, uint64_t* error);

    // ----- Disk usage (BTHClientConnection+DiskUsage.cpp)

    // The bytes the container's files occupy, measured under its identifier
    // lock for writing. A bundle container is measured once: the result is
    // kept as its info value "sys.kelp.Lading.StaticDiskUsage" and answered
    // from there afterwards, unchecked. 0 with 11 for a missing UUID or an
    // invalid class, 0 with 21 for an unknown container.
    uint64_t diskUsageForUserId(uid_t userId, const std::optional<Uuid>& uuid,
                                const std::optional<std::string>& identifier,
                                uint64_t containerClass, uint64_t* error);

    // ----- Death row (BTHClientConnection+DeathRow.cpp)

    // Moves the item into a fresh directory of its own on death row (a
    // missing item is not a failure), then, with `startDeletionThread`,
    // schedules the emptying of death row.
    bool _moveItemAtURLToDeathRow(const std::filesystem::path& url, bool isDir,
                                  bool startDeletionThread, BTHErrorRef* error);
    // Schedules the destruction of everything on death row on the death-row
    // queue, inside a transaction, and returns at once; `completion` gets 1
    // or the last error's code.
    void deleteContainersOnDeathRowWithCompletion(std::function<void(uint64_t)> completion);
    // Removes the item (a missing one counts as removed) or, failing that,
    // moves it aside into the device's "/tmp".
    bool _removeItemOrMoveToTempAtURL(const std::filesystem::path& url, BTHErrorRef* error);

    // ----- Removal (BTHClientConnection+Delete.cpp)

    // Stages each named container for deletion: one rename into death row,
    // then out of the sandbox mapping and the cache. The four lists are
    // index-aligned and must have the same length (11 otherwise). Entries
    // that are malformed, unknown or cannot be moved are skipped (logged);
    // a cache failure stops the walk. Death row is not emptied here.
    void stageForDeleteContainersWithUsers(
        const std::vector<uid_t>& users, const std::vector<std::optional<Uuid>>& uuids,
        const std::optional<std::vector<std::optional<std::string>>>& identifiers,
        const std::vector<Value>& classes, bool useLocking, uint64_t* error);
    // Looks the container up and stages it; `error` is set to 1 first.
    void deleteContainerForUser(uid_t userId, const std::optional<std::string>& identifier,
                                uint64_t containerClass, bool transient, uint64_t* error);
    // Gives a data container the contents of a new one while it keeps its
    // UUID and path; the old contents go to death row. `error` is set to 1
    // first.
    void deleteDataContainerContentForUser(uid_t userId,
                                           const std::optional<std::string>& identifier,
                                           uint64_t containerClass, uint64_t* error);

    // ----- Replace (BTHClientConnection+Replace.cpp)

    // Puts the new container in the place of the old one (or, without an
    // old one, moves it to a permanent place), journaled so that a crash at
    // any point is finished or undone by the next start's recovery. A
    // failed replace leaves the old container where it was.
    void replaceContainer(const BTHReplaceRequest& request, uint64_t* error);
    bool _writeToDiskReplaceAt(const std::filesystem::path& journal,
                               const std::filesystem::path& oldURL,
                               const std::filesystem::path& newURL,
                               const std::filesystem::path& stagingURL,
                               const std::filesystem::path& destinationURL, BTHErrorRef* error);
    std::optional<BTHReplaceJournal> _readAndValidateReplaceFileAtUrl(
        const std::filesystem::path& journal, BTHErrorRef* error);
    // Finishes or undoes every replace whose journal is still on disk.
    bool _recoverFromReplaceOperationsWithError(BTHErrorRef* error);

    // ----- Regeneration (BTHClientConnection+Regenerate.cpp)

    // Gives the container a fresh directory name in the same parent; its
    // UUID, identifier, class and contents stay.
    void regenerateDirectoryUUIDForUser(uid_t userId, const std::optional<Uuid>& uuid,
                                        const std::optional<std::string>& identifier,
                                        uint64_t containerClass, uint64_t* error);
    // Every system container that is not well known, after a build upgrade.
    void _regenerateAllSystemContainerPaths();

    // ----- Start-up (BTHClientConnection+Setup.cpp)

    // Every start: recovery of interrupted replaces.
    void berthSetup();
    // Every start, after the setup: staging leftovers to death row, then
    // death row emptied.
    void berthCleanup();

    // ----- First start after boot (BTHClientConnection+FirstBoot.cpp)

    // Transient containers of every kind to death row, then whatever is not
    // a container in the container directories of the current user (data
    // and group classes), of user 33 (bundle classes) and of user 499
    // (system classes). Death row is emptied by the cleanup that follows.
    void rebootBerthCleanup();
    // Every item of the class directory that is not named like a container
    // of the class, or is so named but holds no metadata file, to death row.
    void _cleanupOrphanedDataForUser(uid_t userId, uint64_t containerClass);
    // The retry test: stores the countdown in the info of the container
    // "sys.kelp.retryTest" and, while it is above 0, ends the process with
    // status 0 two seconds later (the request gets no reply). At 0 the
    // container is staged for deletion and `error` gets 1.
    void retryTestForUser(uid_t userId, uint64_t numCrashes, uint64_t* error);

  private:
    uint64_t runRetryTest(uid_t userId, uint64_t numCrashes);
    BTHErrorRef stageOneForDelete(uid_t userId, const std::optional<Uuid>& uuid,
                                  const std::optional<std::string>& identifier,
                                  const Value& classValue);
    bool mayWipe(const std::string& identifier, uint64_t containerClass) const;
    BTHErrorRef regenerateChosen(uid_t userId, const Uuid& uuid,
                                 const std::optional<std::string>& identifier,
                                 uint64_t containerClass);
    BTHErrorRef regenerateOne(const BTHMetadataRef& record);

    // Steps of a create-or-look-up that need no lock: arguments, the user
    // for the class, and the right to a system container.
    BTHErrorRef checkCreateOrLookupRequest(uid_t userId,
                                           const std::optional<std::string>& identifier,
                                           uint64_t containerClass);

    std::optional<std::string> clientBundleIdentifier_;
    uid_t clientUserId_ = 0;
    std::atomic<bool> allowOtherIdLookup_{false};
    std::atomic<bool> allowGroupIdLookup_{false};
    std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};

}  // namespace berth
