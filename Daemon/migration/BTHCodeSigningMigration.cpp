#include "BTHCodeSigningMigration.h"

#include <array>
#include <memory>
#include <string>
#include <vector>

#include "BTHClientConnection.h"
#include "BTHContainerCache.h"
#include "BTHFileManager.h"
#include "BTHGlobalConfiguration.h"
#include "BTHLog.h"
#include "BTHMigrationStatus.h"
#include "BTHPropertyListFile.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kLegacyChildrenKey = "sys.kelp.Berth.ChildPluginBundleIDs";
constexpr const char* kLegacyRegisteredByCallerKey =
    "sys.kelp.Berth.EntitlementsRegisteredByCaller";
constexpr const char* kLegacyPlaceholderKey = "sys.kelp.Berth.PlaceholderEntitlements";
constexpr const char* kCachedEntitlementsKey = "Entitlements";

constexpr std::array<uint64_t, 3> kGroupListClasses = {BTHContainerClassDataApplication,
                                                       BTHContainerClassDataSprocketPlugin,
                                                       BTHContainerClassDataVPNPlugin};
constexpr std::array<uint64_t, 4> kCachedInfoClasses = {
    BTHContainerClassBundleApplication, BTHContainerClassBundleSprocketPlugin,
    BTHContainerClassBundleVPNPlugin, BTHContainerClassBundleFramework};

// The data container class an entry made from a bundle container gets.
uint64_t dataClassOfBundleClass(uint64_t bundleClass) {
    switch (bundleClass) {
        case BTHContainerClassBundleApplication:
            return BTHContainerClassDataApplication;
        case BTHContainerClassBundleSprocketPlugin:
            return BTHContainerClassDataSprocketPlugin;
        case BTHContainerClassBundleVPNPlugin:
            return BTHContainerClassDataVPNPlugin;
        default:
            return BTHContainerClassUndefined;
    }
}

// Code-signing information holding nothing but `entitlements`.
Value infoWithEntitlements(Value entitlements) {
    Value info = Value::dictionary();
    info.set(kBTHEntitlementsKey, std::move(entitlements));
    return info;
}

// The strings of a stored child list; none when it is not a list.
std::optional<std::vector<std::string>> stringsOf(const Value* list) {
    if (!list || !list->arrayValue()) return std::nullopt;
    std::vector<std::string> strings;
    for (const Value& item : *list->arrayValue())
        if (const std::string* text = item.string()) strings.push_back(*text);
    return strings;
}

// Takes `key` out of `dictionary`, a dictionary (empty when absent or of
// another kind).
Value takeTable(Value& dictionary, const char* key) {
    const Value* found = dictionary.find(key);
    Value table = found && found->isDictionary() ? *found : Value::dictionary();
    dictionary.erase(key);
    return table;
}

// Removes one info value without identifier locking; the operation's code.
uint64_t clearInfoValue(const BTHMetadataRef& container, const char* key) {
    uint64_t code = BTHErrorSuccess;
    BTHClientConnection::sharedClientConnection()->setInfoValue(
        std::nullopt, std::string(key), container->uid(), container->uuid(),
        container->identifier(), container->containerClass(), false, &code);
    return code;
}

}  // namespace

BTHErrorRef BTHCodeSigningMigration::writeMappingIfStored(bool stored) {
    return stored ? mapping_.writeCodeSigningMappingToDisk() : nullptr;
}

bool BTHCodeSigningMigration::hasValidEntry(const std::string& identifier) const {
    const auto& entries = mapping_.codeSigningMappingDict();
    const auto found = entries.find(identifier);
    return found != entries.end() && found->second && !found->second->isInvalid();
}

void BTHCodeSigningMigration::performAllCodeSigningMigrationAndReconciliation() {
    mapping_.performExclusively([this] {
        _migrateAppGroupIdsFromDataContainersToFile();
        _migrateDataFromLegacyEntitlementsFileToCodeSigningFile();
        _migrateCachedCodeSigningInfoFromBundleContainersToMapping();
        groups_.reconcileGroupContainersOfType(BTHGroupTypeApplication);
    });
}

void BTHCodeSigningMigration::_migrateAppGroupIdsFromDataContainersToFile() {
    BTH_FUNCTION("-[BTHCodeSigningMapping _migrateAppGroupIdsFromDataContainersToFile]");
    // An unreadable status file knows of nothing done: the migration runs,
    // and runs again next time, which its checks make harmless.
    std::unique_ptr<BTHMigrationStatus> status = BTHMigrationStatus::make();
    if (status && status->hasMigrationOccurredForType(kBTHGroupIdMigrationKey)) return;
    BTHLogNotice("Performing group ID migration");

    std::vector<BTHMetadataRef> toClear;
    bool stored = false;
    for (const uint64_t containerClass : kGroupListClasses) {
        BTHErrorRef listError;
        const auto containers = BTHContainerCache::sharedInstance().allContainersForUser(
            kBTHLegacyMobileUserId, containerClass, false, &listError);
        if (!containers) {
            BTHLogError("Failed to fetch list of containers for userId: 501, class %ld : %@",
                        static_cast<long>(containerClass), listError);
            return;
        }
        for (const BTHMetadataRef& container : *containers) {
            const Value* groups = container->info()
                                      ? container->info()->find(kBTHLegacyGroupContainerIDsKey)
                                      : nullptr;
            if (!groups) continue;
            const std::string& identifier = container->identifier();
            BTHLogDebug(
                "Data container for userId: 501, identifier %@ references container IDs: %@",
                identifier, *groups);
            auto& entries = mapping_.codeSigningMappingDict();
            if (!entries.contains(identifier)) {
                BTHLogNotice("Migrating app group entitlements for %@", identifier);
                Value entitlements = Value::dictionary();
                entitlements.set(kBTHApplicationGroupsEntitlement, *groups);
                auto entry = std::make_shared<BTHCodeSigningEntry>(
                    infoWithEntitlements(std::move(entitlements)), containerClass);
                entry->setInvalid(true);
                entries[identifier] = std::move(entry);
                stored = true;
            } else {
                BTHLogNotice(
                    "Deleting app group entitlements for %@ because we already have them in "
                    "mapping",
                    identifier);
            }
            toClear.push_back(container);
        }
    }
    if (BTHErrorRef error = writeMappingIfStored(stored)) {
        BTHLogError("Failed to write code signing mapping to disk following group id migration: %@",
                    error);
        return;
    }
    for (const BTHMetadataRef& container : toClear) {
        const uint64_t code = clearInfoValue(container, kBTHLegacyGroupContainerIDsKey);
        if (code != BTHErrorSuccess)
            BTHLogError("Failed to clear group id metadata for %@ at %@ : %llu",
                        container->identifier(), container->url(),
                        static_cast<unsigned long long>(code));
    }
    if (status) status->setMigrationCompleteForType(kBTHGroupIdMigrationKey);
}

void BTHCodeSigningMigration::_migrateDataFromLegacyEntitlementsFileToCodeSigningFile() {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping _migrateDataFromLegacyEntitlementsFileToCodeSigningFile]");
    BTHFileManager& files = BTHFileManager::defaultManager();
    const std::filesystem::path legacy =
        BTHGlobalConfiguration::sharedInstance().libraryDirectory() /
        kBTHLegacyEntitlementsFileName;
    if (files.itemDoesNotExistAtURL(legacy)) return;
    BTHLogNotice("Performing legacy entitlement migration");
    std::optional<Value> contents =
        BTH_dictionaryWithContentsOfURL(legacy, BTHReadMutableContainersAndLeaves, nullptr);
    if (!contents) {
        BTHLogError("Entitlement File exists at %@, but we unexpectedly cant read it", legacy);
        return;
    }
    const Value children = takeTable(*contents, kLegacyChildrenKey);
    const Value registeredByCaller = takeTable(*contents, kLegacyRegisteredByCallerKey);
    const Value placeholders = takeTable(*contents, kLegacyPlaceholderKey);

    bool stored = false;
    for (const auto& [identifier, entitlements] : *contents->dictionaryValue()) {
        if (hasValidEntry(identifier)) {
            BTHLogNotice(
                "Already have code signing info for %@.  No need to migrate legacy entitlements.",
                identifier);
            continue;
        }
        // Only a dictionary can be entitlements; anything else in the file
        // is damage, and an entry made of it would grant nothing anyway.
        if (!entitlements.isDictionary()) {
            BTHLogError("Ignoring legacy entitlements for %@: not a dictionary", identifier);
            continue;
        }
        BTHLogNotice("Migrating legacy entitlements for %@", identifier);
        auto entry = std::make_shared<BTHCodeSigningEntry>(infoWithEntitlements(entitlements),
                                                           BTHContainerClassUndefined);
        entry->setChildBundleIdentifiers(stringsOf(children.find(identifier)));
        entry->setPlaceholder(placeholders.find(identifier) != nullptr);
        if (BTHTruthValue(registeredByCaller.find(identifier)))
            entry->setRegisteredByCaller(true);
        else
            entry->setInvalid(true);
        mapping_.codeSigningMappingDict()[identifier] = std::move(entry);
        stored = true;
    }
    if (BTHErrorRef error = writeMappingIfStored(stored)) {
        BTHLogError("Failed to write code signing mapping to disk following legacy migration: %@",
                    error);
        return;
    }
    BTHErrorRef removeError;
    if (!files.removeItemAtURL(legacy, &removeError))
        BTHLogError("Failed to remove legacy file at %@: %@", legacy, removeError);
    BTHLogNotice("Legacy entitlement migration completed");
}

void BTHCodeSigningMigration::_migrateCachedCodeSigningInfoFromBundleContainersToMapping() {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping _migrateCachedCodeSigningInfoFromBundleContainersToMapping]");
    std::unique_ptr<BTHMigrationStatus> status = BTHMigrationStatus::make();
    if (status && status->hasMigrationOccurredForType(kBTHCodeSigningMigrationKey)) return;
    BTHLogNotice("Performing code signing migration");

    std::vector<BTHMetadataRef> toClear;
    bool stored = false;
    for (const uint64_t containerClass : kCachedInfoClasses) {
        BTHErrorRef listError;
        const auto containers = BTHContainerCache::sharedInstance().allContainersForUser(
            kBTHBundleUserId, containerClass, false, &listError);
        if (!containers) {
            BTHLogError("Failed to fetch list of containers for class %llu : %@",
                        static_cast<unsigned long long>(containerClass), listError);
            continue;
        }
        for (const BTHMetadataRef& container : *containers) {
            const Value* cached =
                container->info() ? container->info()->find(kBTHCachedCodeSigningInfoKey) : nullptr;
            if (!cached || !cached->isDictionary()) continue;
            const std::string& identifier = container->identifier();
            if (!hasValidEntry(identifier)) {
                BTHLogNotice("Migrating code signing info for %@", identifier);
                Value info = *cached;
                if (const Value* entitlements = cached->find(kCachedEntitlementsKey))
                    info.set(kBTHEntitlementsKey, *entitlements);
                else
                    info.erase(kBTHEntitlementsKey);
                mapping_.codeSigningMappingDict()[identifier] =
                    std::make_shared<BTHCodeSigningEntry>(std::move(info),
                                                          dataClassOfBundleClass(containerClass));
                stored = true;
            } else {
                BTHLogNotice(
                    "Deleting cached code signing info for %@ because we already have it in "
                    "mapping",
                    identifier);
            }
            toClear.push_back(container);
        }
    }
    if (BTHErrorRef error = writeMappingIfStored(stored)) {
        BTHLogError(
            "Failed to write code signing mapping to disk following code signing migration: "
            "%@",
            error);
        return;
    }
    for (const BTHMetadataRef& container : toClear) {
        const uint64_t code = clearInfoValue(container, kBTHCachedCodeSigningInfoKey);
        if (code != BTHErrorSuccess)
            BTHLogError("Error setting info value for identifier: %@, Class: %llu: %llu",
                        container->identifier(),
                        static_cast<unsigned long long>(container->containerClass()),
                        static_cast<unsigned long long>(code));
    }
    if (status) status->setMigrationCompleteForType(kBTHCodeSigningMigrationKey);
}

}  // namespace berth
