#include "BTHMigrationStatus.h"

#include <cerrno>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <mutex>

#include "BTHError.h"
#include "BTHFaultInjection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "BTHPropertyListFile.h"
#include "platform/SystemVersion.h"

namespace berth {
namespace {

constexpr const char* kStatusFileName = "bth_migration_status.plist";
constexpr const char* kVersionNumberKey = "BTHMigrationVersionNumber";
constexpr const char* kTimeKey = "BTHMigrationTime";

// The marker files of older releases, in the order they are folded in.
constexpr struct {
    const char* file;
    const char* type;
} kMarkerFiles[] = {
    {"bth_bundle_migration_complete.plist", kBTHBundleMigrationKey},
    {"bth_acl2_migration_complete.plist", kBTHACLMigrationKey},
    {"bth_group_id_migration_complete.plist", kBTHGroupIdMigrationKey},
    {"bth_code_signing_migration_complete.plist", kBTHCodeSigningMigrationKey},
};

std::filesystem::path inLibrary(const std::string& name) {
    return BTHGlobalConfiguration::sharedInstance().libraryDirectory() / name;
}

// A date as text: year-month-day hours:minutes:seconds and the offset from
// universal time.
std::string nowAsText() {
    const std::time_t now = std::time(nullptr);
    std::tm local{};
    ::localtime_r(&now, &local);
    char text[64];
    std::strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S %z", &local);
    return text;
}

std::optional<std::string> buildVersionIn(const Value& versionInfo) {
    const Value* build = versionInfo.find(kSystemVersionBuildKey);
    if (!build || !build->string()) return std::nullopt;
    return *build->string();
}

std::string releaseTypeIn(const Value& versionInfo) {
    const Value* type = versionInfo.find(kSystemVersionReleaseTypeKey);
    return type && type->string() ? *type->string() : std::string("(null)");
}

}  // namespace

std::unique_ptr<BTHMigrationStatus> BTHMigrationStatus::make() {
    BTH_FUNCTION("-[BTHMigrationStatus init]");
    std::optional<Value> stored = _readMigrationStatusFromDisk();
    if (!stored) {
        BTHLogError("Error reading migration file from disk.  This is bad");
        return nullptr;
    }
    auto status = std::make_unique<BTHMigrationStatus>(std::move(*stored));
    if (status->migrationInfo_.dictionaryValue()->empty())
        status->_migrateFromManyMarkerFilesToOne();
    return status;
}

std::optional<Value> BTHMigrationStatus::_readMigrationStatusFromDisk() {
    BTH_FUNCTION("-[BTHMigrationStatus _readMigrationStatusFromDisk]");
    const std::filesystem::path url = inLibrary(kStatusFileName);
    BTHErrorRef error;
    std::optional<Value> stored = BTH_dictionaryWithContentsOfURL(url, 0, &error);
    if (stored) return stored;
    if (error && error->isPOSIXError(ENOENT)) return Value::dictionary();
    BTHLogError("Failed to read migration status file at %@ : %@", url, error);
    return std::nullopt;
}

bool BTHMigrationStatus::_writeMigrationStatusToDisk() {
    BTH_FUNCTION("-[BTHMigrationStatus _writeMigrationStatusToDisk]");
    const std::filesystem::path url = inLibrary(kStatusFileName);
    BTHErrorRef error;
    if (BTHFaultActive("migration-status.write"))
        error = BTHMakePOSIXError(EIO, "%s", strerror(EIO));
    else if (BTH_writeToURL(migrationInfo_, url, kBTHStateFileWriteOptions, &error))
        return true;
    BTHLogError("Failed to write migration status on %@ for %@ : %@", currentBuildVersion(), url,
                error);
    return false;
}

void BTHMigrationStatus::_readStatusFromMarkerFileWithNameAndSetAsType(const std::string& name,
                                                                       const std::string& type) {
    BTH_FUNCTION("-[BTHMigrationStatus _readStatusFromMarkerFileWithName:andSetAsType:]");
    const std::filesystem::path url = inLibrary(name);
    BTHErrorRef error;
    std::optional<Value> record = BTH_dictionaryWithContentsOfURL(url, 0, &error);
    if (record) {
        migrationInfo_.set(type, std::move(*record));
    } else if (!error || !error->isPOSIXError(ENOENT)) {
        BTHLogError("Failed to read migration marker file at %@ : %@", url, error);
    }
}

void BTHMigrationStatus::_removeMarkerFileWithName(const std::string& name) {
    BTH_FUNCTION("-[BTHMigrationStatus _removeMarkerFileWithName:]");
    const std::filesystem::path url = inLibrary(name);
    BTHErrorRef error;
    if (!BTHFileManager::defaultManager().removeItemAtURL(url, &error))
        BTHLogError("Failed to remove marker file at %@: %@", url, error);
}

void BTHMigrationStatus::_migrateFromManyMarkerFilesToOne() {
    BTH_FUNCTION("-[BTHMigrationStatus _migrateFromManyMarkerFilesToOne]");
    BTHLogNotice("Migrating from many marker files down to one");
    for (const auto& marker : kMarkerFiles)
        _readStatusFromMarkerFileWithNameAndSetAsType(marker.file, marker.type);
    // The markers go only once what they said is safely in the one file.
    if (!_writeMigrationStatusToDisk()) return;
    for (const auto& marker : kMarkerFiles) _removeMarkerFileWithName(marker.file);
}

bool BTHMigrationStatus::hasMigrationOccurredForType(const std::string& type) const {
    return migrationInfo_.find(type) != nullptr;
}

void BTHMigrationStatus::setMigrationCompleteForType(const std::string& type) {
    BTH_FUNCTION("-[BTHMigrationStatus setMigrationCompleteForType:]");
    Value record = Value::dictionary();
    record.set(kVersionNumberKey, Value(currentBuildVersion()));
    record.set(kTimeKey, Value(nowAsText()));
    migrationInfo_.set(type, std::move(record));
    if (_writeMigrationStatusToDisk())
        BTHLogNotice("Migration completed on %@ for %@", currentBuildVersion(), type);
}

void BTHMigrationStatus::writeCurrentBuildInfoToDisk() {
    BTH_FUNCTION("-[BTHMigrationStatus writeCurrentBuildInfoToDisk]");
    if (std::optional<Value> current = systemVersionDictionary())
        migrationInfo_.set(kBTHLastBuildInfoKey, std::move(*current));
    else
        migrationInfo_.erase(kBTHLastBuildInfoKey);
    if (_writeMigrationStatusToDisk())
        BTHLogNotice("Saved last build version of %@", currentBuildVersion());
}

bool BTHMigrationStatus::isBuildUpgrade() const {
    BTH_FUNCTION("-[BTHMigrationStatus isBuildUpgrade]");
    const Value* last = migrationInfo_.find(kBTHLastBuildInfoKey);
    if (!last) {
        BTHLogNotice(
            "Did not find last build info; we must be upgrading from pre-9.3.1 or this is an "
            "erase install.");
        return true;
    }
    const std::optional<std::string> lastBuild = buildVersionIn(*last);
    if (!lastBuild) {
        BTHLogError(
            "Could not get build version from last build info dictionary; assuming this is an "
            "upgrade");
        return true;
    }
    const std::optional<Value> current = systemVersionDictionary();
    if (!current) {
        BTHLogError("Could not get current build info; assuming this is an upgrade");
        return true;
    }
    const std::optional<std::string> currentBuild = buildVersionIn(*current);
    if (!currentBuild) {
        BTHLogError("Could not get current build string; assuming this is an upgrade");
        return true;
    }
    if (*currentBuild == *lastBuild) {
        BTHLogNotice(
            "Current build version (%@ / %@) equal to last version recorded (%@ / %@); skipping "
            "upgrade",
            *currentBuild, releaseTypeIn(*current), *lastBuild, releaseTypeIn(*last));
        return false;
    }
    BTHLogNotice("Detected upgrade from %@ (%@) to %@ (%@)", *lastBuild, releaseTypeIn(*last),
                 *currentBuild, releaseTypeIn(*current));
    return true;
}

const std::string& BTHMigrationStatus::currentBuildVersion() {
    static const std::string version = [] {
        std::optional<Value> current = systemVersionDictionary();
        std::optional<std::string> build = current ? buildVersionIn(*current) : std::nullopt;
        return build.value_or("Unknown");
    }();
    return version;
}

}  // namespace berth
