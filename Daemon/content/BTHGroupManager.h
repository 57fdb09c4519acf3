// BTHGroupManager: group containers, the shared directories of application
// groups (class 7, the current mobile user) and system groups (class 13,
// user 499). A group container is referenced once for every identifier in the
// code-signing mapping whose entitlements name its group; the counts are
// recomputed from the mapping whenever they are needed and never stored.
//
// A group container comes into being the first time the group containers of
// an entitled identifier are asked for, and goes (staged for deletion) when
// an identifier that was its last reference drops the group, or when
// reconciliation finds nothing referencing it.
//
// Locking: the two queries hold the all-identifiers lock for writing for
// their whole work and call the container operations without locking. The
// change handling and reconciliation take no lock: code-signing processing
// and the migrations call them holding the all-identifiers lock, from the
// code-signing queue, so they read the mapping directly.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "BTHClientConnection.h"
#include "BTHCodeSigningMapping.h"

namespace berth {

class BTHGroupManager {
  public:
    // Group identifier -> absolute path of its container.
    using GroupPaths = std::map<std::string, std::string>;

    // The shared instance, over the shared code-signing store; made once.
    static BTHGroupManager& defaultManager();
    // A manager over `mapping` (null: a process without store, where no
    // identifier has groups).
    explicit BTHGroupManager(BTHCodeSigningMapping* mapping) : mapping_(mapping) {}

    // The group containers `identifier` is entitled to, found or created:
    // system groups for user 499, application groups for any other user.
    // A group that cannot be had is left out (logged). Marks `client` as
    // allowed to look up group identifiers. None with 11 for a missing
    // identifier, 40 on an exception.
    std::optional<GroupPaths> groupContainerPathsForUser(
        uid_t userId, BTHClientConnection& client, const std::optional<std::string>& identifier,
        uint64_t* error);
    // The identifier's application groups (whatever the user); no container
    // is created or looked up. None with 11 for a missing identifier.
    std::optional<std::vector<std::string>> groupContainerIdentifiersForUser(
        uid_t userId, const std::optional<std::string>& identifier, uint64_t* error);

    // An identifier's groups of `type` change from `oldIds` to `newIds`:
    // each group it no longer names whose only reference it was is staged
    // for deletion. Called while the mapping still holds the old entry.
    void handleChangeFromOldGroupContainerIds(std::optional<std::vector<std::string>> oldIds,
                                              const std::optional<std::vector<std::string>>& newIds,
                                              BTHGroupType type);
    // Stages for deletion every group container of `type` that no identifier
    // references.
    void reconcileGroupContainersOfType(BTHGroupType type);

    // How many identifiers reference each group of `type` (a group listed
    // twice by one identifier counts twice); none without store.
    using ReferenceCounts = std::map<std::string, long>;
    std::optional<ReferenceCounts> copyReferenceCountSetOfType(BTHGroupType type);

  private:
    void removeReferenceForGroupIdentifiers(const std::vector<std::string>& groups,
                                            BTHGroupType type);
    void removeGroupContainersIfNeeded(uid_t userId, uint64_t containerClass,
                                       const std::vector<std::string>& groups,
                                       ReferenceCounts& counts);
    void cleanupUnreferencedGroupContainers(uid_t userId, uint64_t containerClass,
                                            const ReferenceCounts& counts);
    // The current mobile user when its base directory exists.
    static std::optional<uid_t> mobileUserWithBaseDirectory();

    BTHCodeSigningMapping* mapping_;
};

// The hooks that let code-signing processing lock all identifiers, stage a
// withdrawn system container and tell `groups` of changed groups; start-up
// gives them to the shared store.
BTHCodeSigningHooks BTHMakeCodeSigningHooks(BTHGroupManager& groups);

}  // namespace berth
