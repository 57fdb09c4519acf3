// BTHClientConnection: the caller of one request, with its identity and
// rights. One is made per request (or held by the completion of an
// asynchronous command until it has replied); the daemon's own instance,
// sharedClientConnection(), does start-up and maintenance work.
//
// The container operations of this class are added by the modules that
// implement them (BTHClientConnection+Create.cpp, ...).
#pragma once

#include <sys/types.h>

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
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
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
    // `useLocking` the whole operation holds the all-identifiers lock for
    // writing. On failure returns null and stores the code through `error`.
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

  private:
    // Steps of a create-or-look-up that need no lock: arguments, the user
    // for the class, and the right to a system container.
    BTHErrorRef checkCreateOrLookupRequest(uid_t userId,
                                           const std::optional<std::string>& identifier,
                                           uint64_t containerClass);

    std::optional<std::string> clientBundleIdentifier_;
    uid_t clientUserId_ = 0;
    bool allowOtherIdLookup_ = false;
    bool allowGroupIdLookup_ = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};

}  // namespace berth
