// Which once-per-device migrations have completed, and which build last did
// the daemon's first-boot work: both kept in "bth_migration_status.plist" in
// the daemon's library directory. The four marker files of older releases
// are folded into it the first time it is found empty.
//
// There is no shared instance: each user makes one, which loads the file
// then and holds its own copy.
#pragma once

#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"

namespace berth {

// Migration keys of the status file.
inline constexpr const char* kBTHBundleMigrationKey = "BundleMigration";
inline constexpr const char* kBTHACLMigrationKey = "ACLMigration";
inline constexpr const char* kBTHGroupIdMigrationKey = "GroupIdMigration";
inline constexpr const char* kBTHCodeSigningMigrationKey = "CodeSigningMigration";
inline constexpr const char* kBTHLastBuildInfoKey = "LastBuildInfo";

class BTHMigrationStatus {
  public:
    // Loads the status file (a missing one is empty and gets the marker
    // files folded in). Null when the file exists but cannot be read as a
    // dictionary: then nothing is known to have happened.
    static std::unique_ptr<BTHMigrationStatus> make();

    // Whether `type`'s key is present, whatever its value.
    bool hasMigrationOccurredForType(const std::string& type) const;
    // Records `type` complete now, in this build, and writes the file; a
    // failed write keeps the record in memory only.
    void setMigrationCompleteForType(const std::string& type);
    // Whether the running build differs from the one recorded last; any
    // doubt counts as an upgrade.
    bool isBuildUpgrade() const;
    // Records the running build's version information and writes the file.
    void writeCurrentBuildInfoToDisk();

    // The running system's build version, read once per process; "Unknown"
    // when it cannot be read.
    static const std::string& currentBuildVersion();

    const Value& migrationInfo() const { return migrationInfo_; }

    // Made by make() only.
    explicit BTHMigrationStatus(Value migrationInfo) : migrationInfo_(std::move(migrationInfo)) {}

  private:
    static std::optional<Value> _readMigrationStatusFromDisk();
    bool _writeMigrationStatusToDisk();
    void _migrateFromManyMarkerFilesToOne();
    void _readStatusFromMarkerFileWithNameAndSetAsType(const std::string& name,
                                                       const std::string& type);
    static void _removeMarkerFileWithName(const std::string& name);

    Value migrationInfo_;
};

}  // namespace berth
