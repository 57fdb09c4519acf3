// Entries leave the mapping with their bundle containers: a deleted bundle
// takes its identifier's and its children's entries (and so their groups and
// system container); a replaced one, or one that is no longer installed,
// leaves them marked invalid, hidden from clients until the installer
// reports them again.
#include <algorithm>

#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

// The bundle classes an installed item may live in, in the order asked.
constexpr uint64_t kBundleClasses[] = {BTHContainerClassBundleApplication,
                                       BTHContainerClassBundleSprocketPlugin,
                                       BTHContainerClassBundleVPNPlugin};

}  // namespace

void BTHCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier) {
    onCodeSignQueue(
        [&] { onQueueRemoveCodeSigningDictionariesForIdentifierAndItsChildren(identifier); });
}

void BTHCodeSigningMapping::onQueueRemoveCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier) {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping "
        "_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren:]");
    std::vector<std::string> doomed;
    if (const BTHCodeSigningEntry* entry = storedEntry(identifier)) {
        if (entry->childBundleIdentifiers()) doomed = *entry->childBundleIdentifiers();
    }
    doomed.push_back(identifier);
    for (const std::string& each : doomed) {
        const uint64_t code = onQueueProcessCodeSigningInfo(std::nullopt, each, std::nullopt);
        if (code != BTHErrorSuccess)
            BTHLogError("Failed to clear entitlements for %@ : %llu", each, code);
    }
}

bool BTHCodeSigningMapping::invalidateCodeSigningInfoForIdentifierAndItsChildren(
    const std::string& identifier, BTHErrorRef* error) {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping _onQueue_invalidateCodeSigningInfoForIdentifierAndItsChildren:]");
    BTHErrorRef writeError = onCodeSignQueue([&] {
        Mapping& mapping = codeSigningMappingDict();
        auto found = mapping.find(identifier);
        if (found != mapping.end()) {
            found->second->setInvalid(true);
            BTHLogDebug("Invalidating code signing info for %@", identifier);
            if (const auto& children = found->second->childBundleIdentifiers()) {
                for (const std::string& child : *children) {
                    auto childEntry = mapping.find(child);
                    if (childEntry == mapping.end()) continue;
                    childEntry->second->setInvalid(true);
                    BTHLogDebug("Invalidating code signing info for %@ child: %@", identifier,
                                child);
                }
            }
        }
        return writeCodeSigningMappingToDisk();
    });
    if (!writeError) return true;
    BTHSetError(error, writeError);
    return false;
}

uint64_t BTHCodeSigningMapping::invalidateCodeSigningInfoForAppsWithoutBundleContainer() {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping _onQueue_invalidateCodeSigningInfoForAppsWithoutBundleContainer]");
    BTHErrorRef writeError = lockingAll([&] {
        BTHContainerCache& cache = BTHContainerCache::sharedInstance();
        std::vector<std::string> orphans;
        for (const auto& stored : codeSigningMappingDict_) {
            const std::string& identifier = stored.first;
            if (stored.second->isRegisteredByCaller()) continue;
            const bool hasBundle = std::any_of(
                std::begin(kBundleClasses), std::end(kBundleClasses), [&](uint64_t bundleClass) {
                    return cache.containerForUser(kBTHBundleUserId, bundleClass, identifier, false,
                                                  nullptr) != nullptr;
                });
            if (!hasBundle) orphans.push_back(identifier);
        }
        for (const std::string& identifier : orphans) {
            codeSigningMappingDict_.at(identifier)->setInvalid(true);
            BTHLogDebug("Invalidating the code signing info for: %@", identifier);
        }
        return writeCodeSigningMappingToDisk();
    });
    return writeError ? writeError->code64() : uint64_t{BTHErrorSuccess};
}

}  // namespace berth
