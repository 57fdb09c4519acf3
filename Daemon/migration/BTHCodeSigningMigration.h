// BTHCodeSigningMigration: moves what older releases kept of code signing
// elsewhere into the code-signing store, then lets the group manager drop
// every application-group container nothing references any more.
//
// Three sources, each removed from its old place only after the mapping file
// holding its content has been written:
//
//   - "sys.kelp.Lading.GroupContainerIDs" in the info of data containers of
//     user 501 (classes 2, 4, 6): becomes an invalid entry holding only the
//     group list; once per device ("GroupIdMigration").
//   - "bth_entitlements.plist" in the daemon's library directory: every
//     identifier's entitlements, children, placeholder and registered-by-
//     caller marks; whenever the file exists.
//   - "sys.kelp.Lading.CachedCodeSigningInfo" in the info of bundle
//     containers of user 33 (classes 1, 3, 5, 8): once per device
//     ("CodeSigningMigration").
//
// A failed listing or mapping write stops that one source without clearing
// anything or recording completion, so the next data migration repeats it.
#pragma once

#include "BTHCodeSigningMapping.h"
#include "BTHGroupManager.h"

namespace berth {

inline constexpr const char* kBTHLegacyEntitlementsFileName = "bth_entitlements.plist";
inline constexpr const char* kBTHLegacyGroupContainerIDsKey = "sys.kelp.Lading.GroupContainerIDs";

class BTHCodeSigningMigration {
  public:
    BTHCodeSigningMigration(BTHCodeSigningMapping& mapping, BTHGroupManager& groups)
        : mapping_(mapping), groups_(groups) {}

    // All three migrations, then reconciliation of the application groups,
    // with the mapping held exclusively throughout. Failures are logged.
    void performAllCodeSigningMigrationAndReconciliation();

    // The steps, each assuming the mapping is already held exclusively.
    void _migrateAppGroupIdsFromDataContainersToFile();
    void _migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
    void _migrateCachedCodeSigningInfoFromBundleContainersToMapping();

  private:
    // Writes the mapping file when a step `stored` entries; its error, or
    // null.
    BTHErrorRef writeMappingIfStored(bool stored);
    // A valid entry exists for `identifier` (an invalid one may be replaced).
    bool hasValidEntry(const std::string& identifier) const;

    BTHCodeSigningMapping& mapping_;
    BTHGroupManager& groups_;
};

}  // namespace berth
