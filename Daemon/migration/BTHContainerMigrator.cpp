#include "BTHContainerMigrator.h"

#include <array>
#include <cctype>
#include <cstdint>
#include <string>

#include "BTHCodeSigningMigration.h"
#include "BTHContainerCache.h"
#include "BTHFaultInjection.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHGroupManager.h"
#include "BTHLog.h"
#include "BTHWhitelist.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"

namespace berth {

namespace {

constexpr uint32_t kMultiUserFlag = 1u << 31;
constexpr std::array<uint64_t, 2> kSystemClasses = {BTHContainerClassDataSystem,
                                                    BTHContainerClassSharedSystemGroup};

// The integer a file-name extension starts with (0 when it starts with none).
int64_t leadingInteger(const std::string& text) {
    size_t i = 0;
    while (i < text.size() && std::isspace(static_cast<unsigned char>(text[i]))) ++i;
    bool negative = false;
    if (i < text.size() && (text[i] == '-' || text[i] == '+')) negative = text[i++] == '-';
    uint64_t value = 0;
    for (; i < text.size() && std::isdigit(static_cast<unsigned char>(text[i])); ++i)
        value = value * 10 + static_cast<uint64_t>(text[i] - '0');
    return negative ? -static_cast<int64_t>(value) : static_cast<int64_t>(value);
}

// The name's last extension ("" when it has none) and the name without it.
std::pair<std::string, std::string> splitExtension(const std::string& name) {
    const size_t dot = name.rfind('.');
    if (dot == std::string::npos || dot == 0) return {name, ""};
    return {name.substr(0, dot), name.substr(dot + 1)};
}

bool systemClassDirectoryExists(uint64_t containerClass) {
    const auto base =
        BTHGlobalConfiguration::sharedInstance().globalContainerBaseURLWithContentClass(
            containerClass, false);
    return base && !BTHFileManager::defaultManager().itemDoesNotExistAtURL(*base);
}

}  // namespace

BTHContainerMigrator& BTHContainerMigrator::sharedInstance() {
    static BTHContainerMigrator migrator;
    return migrator;
}

bool BTHContainerMigrator::performSynchronousBuildUpgradeMigration(BTHMigrationStatus& status,
                                                                   BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator performSynchronousBuildUpgradeMigration:withError:]");
    if (!(DeviceProperties::multiUserFlags() & kMultiUserFlag)) migrateOldUserDirectories();
    BTHCrashPoint("migration.after-user-directories");

    BTHFileManager& files = BTHFileManager::defaultManager();
    const std::filesystem::path oldBundles = DeviceRoot::resolve(kBTHOldBundleContainersPath);
    if (files.itemExistsAtURL(oldBundles)) {
        BTHLogNotice("Moving bundle containers from user to system location");
        BTHErrorRef moveError;
        if (!files.moveItemAtURL(oldBundles,
                                 BTHGlobalConfiguration::sharedInstance().bundleDirectory(),
                                 &moveError)) {
            BTHLogError(
                "Failed to migrate to new bundle containers location : %@.  This is "
                "terrible.",
                moveError);
            return false;
        }
    }
    BTHCrashPoint("migration.after-bundle-move");

    _checkIfDeviceMayNeedSystemContainerACLMigration(status);
    BTHErrorRef whitelistError;
    if (!_performWhitelistMigrationWithError(&whitelistError)) {
        BTHLogError("Failed to migrate whitelisted bundle containers : %@", whitelistError);
        BTHSetError(error, std::move(whitelistError));
        return false;
    }
    return true;
}

void BTHContainerMigrator::migrateOldUserDirectories() {
    BTH_FUNCTION("-[BTHContainerMigrator performSynchronousBuildUpgradeMigration:withError:]");
    const auto user = BTHGlobalConfiguration::sharedInstance().getPerUserConfigurationForUserId(
        kBTHLegacyMobileUserId);
    BTHFileManager& files = BTHFileManager::defaultManager();
    if (const auto oldLibrary = user->oldLibraryDirectoryPath()) {
        BTHErrorRef removeError;
        if (!files.removeItemAtURL(*oldLibrary, &removeError))
            BTHLogError("Failed to remove old Library directory: %@", removeError);
    }
    const auto oldLogging = user->oldLoggingPath();
    if (!oldLogging) return;
    migrateOldLogFiles(*oldLogging);
    BTHErrorRef removeError;
    if (!files.removeItemAtURL(*oldLogging, &removeError))
        BTHLogError("Failed to remove old Log directory: %@", removeError);
}

void BTHContainerMigrator::migrateOldLogFiles(const std::filesystem::path& oldLoggingPath) {
    BTH_FUNCTION("-[BTHContainerMigrator performSynchronousBuildUpgradeMigration:withError:]");
    BTHFileManager& files = BTHFileManager::defaultManager();
    BTHErrorRef listError;
    const auto items = files.urlsForItemsInDirectoryAtURL(oldLoggingPath, &listError);
    if (!items) {
        if (!listError || !listError->isPOSIXError(ENOENT))
            BTHLogError("Failed to get items for deletion: %@ : %@", oldLoggingPath, listError);
        return;
    }
    const std::filesystem::path logDirectory =
        BTHGlobalConfiguration::sharedInstance().logDirectory();
    for (const BTHFileURL& item : *items) {
        const auto [stem, extension] = splitExtension(item.path.filename().string());
        const uint32_t next = static_cast<uint32_t>(leadingInteger(extension)) + 1;
        // Older files than the log keeps stay, and go with the directory.
        if (next > BTHLogFileCount()) continue;
        BTHErrorRef moveError;
        if (!files.moveItemAtURL(item.path, logDirectory / (stem + "." + std::to_string(next)),
                                 &moveError))
            BTHLogError("Failed to move to new logging directory from %@ : %@", item.path,
                        moveError);
    }
    BTHLogNotice("Migrated log files on %@", BTHMigrationStatus::currentBuildVersion());
}

void BTHContainerMigrator::_checkIfDeviceMayNeedSystemContainerACLMigration(
    BTHMigrationStatus& status) {
    BTH_FUNCTION("-[BTHContainerMigrator _checkIfDeviceMayNeedSystemContainerACLMigration:]");
    if (status.hasMigrationOccurredForType(kBTHACLMigrationKey)) return;
    if (systemClassDirectoryExists(BTHContainerClassDataSystem) ||
        systemClassDirectoryExists(BTHContainerClassSharedSystemGroup))
        return;
    BTHLogNotice("No system containers requiring ACL migration");
    status.setMigrationCompleteForType(kBTHACLMigrationKey);
}

bool BTHContainerMigrator::_performWhitelistMigrationWithError(BTHErrorRef* error) {
    for (const uint64_t containerClass : kSystemClasses)
        if (!migrateWellKnownContainersOfClass(containerClass, error)) return false;
    return true;
}

bool BTHContainerMigrator::migrateWellKnownContainersOfClass(uint64_t containerClass,
                                                             BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator _performWhitelistMigrationWithError:]");
    static constexpr const char* kOperation =
        "-[BTHContainerMigrator _performWhitelistMigrationWithError:]";
    BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
    BTHContainerCache& cache = BTHContainerCache::sharedInstance();
    const BTHWhitelist& wellKnown = BTHWhitelist::sharedWhitelist();
    const auto base =
        configuration.containerDirectoryURLForUser(kBTHSystemUserId, containerClass, false);
    BTHErrorRef listError;
    const auto containers =
        cache.allContainersForUser(kBTHSystemUserId, containerClass, false, &listError);
    if (!containers || !base) {
        BTHLogError("Failed to get list of system containers for migration: (error= %@ : %lld)",
                    listError ? listError->domain() : std::string(),
                    listError ? static_cast<long long>(listError->code()) : 0LL);
        BTHSetError(error, std::move(listError));
        return false;
    }
    for (const BTHMetadataRef& record : *containers) {
        const std::string& identifier = record->identifier();
        if (!wellKnown.containerIdIsWellknown(identifier, containerClass)) continue;
        const auto name = wellKnown.wellknownContainerForId(identifier, containerClass);
        if (!name) continue;
        const std::filesystem::path target = *base / *name;
        if (record->url().empty() || record->url() == target) continue;
        const std::filesystem::path old = record->url();
        BTHLogError("Migrating well-known container %@ from %@ to %@", identifier, old, target);
        BTHErrorRef stepError;
        if (!cache.removeContainerForUser(kBTHSystemUserId, containerClass, identifier, false,
                                          &stepError)) {
            BTHLogError(
                "%s: Failed to remove cache for whitelisted container %@: (error= %@: %lld)",
                kOperation, identifier, stepError ? stepError->domain() : std::string(),
                stepError ? static_cast<long long>(stepError->code()) : 0LL);
            BTHSetError(error, std::move(stepError));
            return false;
        }
        if (!BTHFileManager::defaultManager().moveItemAtURL(old, target, &stepError)) {
            BTHLogError(
                "%s: Failed to move system container %@ from %@ to whitelisted location %@: "
                "(error= %@: %lld)",
                kOperation, identifier, old, target,
                stepError ? stepError->domain() : std::string(),
                stepError ? static_cast<long long>(stepError->code()) : 0LL);
            BTHSetError(error, std::move(stepError));
            return false;
        }
        BTHCrashPoint("migration.whitelist.after-move");
        record->setUrl(target);
        if (!cache.addContainerMetadata(record, kBTHSystemUserId, target, false, &stepError)) {
            BTHLogError(
                "%s: Failed to update cache for whitelisted container %@: (error= %@: %lld)",
                kOperation, identifier, stepError ? stepError->domain() : std::string(),
                stepError ? static_cast<long long>(stepError->code()) : 0LL);
            BTHSetError(error, std::move(stepError));
            return false;
        }
    }
    return true;
}

bool BTHContainerMigrator::performDataMigratorMigrationWithError(BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator performDataMigratorMigrationWithError:]");
    bool result = false;
    BTHErrorRef stepError;
    BTHErrorRef exceptionError = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        result = performDataMigrationSteps(&stepError);
        return BTHErrorRef();
    });
    if (exceptionError) {
        BTHSetError(error, std::move(exceptionError));
        return false;
    }
    if (!result) BTHSetError(error, std::move(stepError));
    return result;
}

bool BTHContainerMigrator::performDataMigrationSteps(BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator performDataMigratorMigrationWithError:]");
    BTHLogNotice("Performing Data Migration on %@", BTHMigrationStatus::currentBuildVersion());
    bool result = true;
    BTHErrorRef stepError;
    if (!_performInternalACLMigrationWithError(&stepError)) {
        BTHLogError("Failed to migrate ACLs on system containers : %@", stepError);
        BTHSetError(error, stepError);
        result = false;
    }
    BTHCrashPoint("migration.data.after-acl");
    if (!_performBundleContainerOwnershipMigrationWithError(&stepError)) {
        BTHLogError("Failed to migrate bundle containers to system location : %@", stepError);
        BTHSetError(error, stepError);
        result = false;
    }
    BTHCrashPoint("migration.data.after-ownership");
    if (BTHCodeSigningMapping* mapping = BTHCodeSigningMapping::sharedInstance())
        BTHCodeSigningMigration(*mapping, BTHGroupManager::defaultManager())
            .performAllCodeSigningMigrationAndReconciliation();
    return result;
}

bool BTHContainerMigrator::_performInternalACLMigrationWithError(BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator _performInternalACLMigrationWithError:]");
    std::unique_ptr<BTHMigrationStatus> status = BTHMigrationStatus::make();
    if (status && status->hasMigrationOccurredForType(kBTHACLMigrationKey)) return true;
    BTHGlobalConfiguration& configuration = BTHGlobalConfiguration::sharedInstance();
    BTHFileManager& files = BTHFileManager::defaultManager();

    BTHErrorRef systemError;
    if (systemClassDirectoryExists(BTHContainerClassDataSystem)) {
        const auto directory = configuration.containerDirectoryURLForUser(
            kBTHSystemUserId, BTHContainerClassDataSystem, false);
        if (directory && !files.standardizeAllSystemContainerACLsAtURL(*directory, &systemError))
            BTHLogError("Failed to set ACLs on system containers : %@", systemError);
    }
    if (systemClassDirectoryExists(BTHContainerClassSharedSystemGroup)) {
        const auto directory = configuration.containerDirectoryURLForUser(
            kBTHSystemUserId, BTHContainerClassSharedSystemGroup, false);
        BTHErrorRef groupError;
        if (directory && !files.standardizeAllSystemContainerACLsAtURL(*directory, &groupError)) {
            BTHLogError("Failed to set ACLs on system group containers : %@", groupError);
            BTHSetError(error, std::move(groupError));
            return false;
        }
    }
    if (systemError) {
        BTHSetError(error, std::move(systemError));
        return false;
    }
    if (status) status->setMigrationCompleteForType(kBTHACLMigrationKey);
    return true;
}

bool BTHContainerMigrator::_performBundleContainerOwnershipMigrationWithError(BTHErrorRef* error) {
    BTH_FUNCTION("-[BTHContainerMigrator _performBundleContainerOwnershipMigrationWithError:]");
    std::unique_ptr<BTHMigrationStatus> status = BTHMigrationStatus::make();
    if (status && status->hasMigrationOccurredForType(kBTHBundleMigrationKey)) return true;
    BTHLogNotice("Changing ownership of bundle container content.");
    const std::filesystem::path bundles =
        BTHGlobalConfiguration::sharedInstance().bundleDirectory();
    BTHErrorRef ownerError;
    if (!BTHFileManager::defaultManager().standardizeOwnershipAtURL(
            bundles, kBTHBundleUserId, kBTHBundleUserId, &ownerError)) {
        BTHSetError(error, BTHMakeError(BTHErrorChangeOwnerFailed, ownerError,
                                        "Failed to change owner of %@: %@", bundles, ownerError));
        return false;
    }
    if (status) status->setMigrationCompleteForType(kBTHBundleMigrationKey);
    return true;
}

}  // namespace berth
