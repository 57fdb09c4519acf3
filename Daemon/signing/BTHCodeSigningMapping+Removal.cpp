#include "BTHCodeSigningMapping.h"
#include "BTHLog.h"

namespace berth {

void BTHCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier) {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping "
        "_onQueue_removeCodeSigningDictionariesForIdentifierAndItsChildren:]");
    onCodeSignQueue([&] {
        std::vector<std::string> doomed;
        if (const BTHCodeSigningEntry* entry = storedEntry(identifier)) {
            if (entry->childBundleIdentifiers()) doomed = *entry->childBundleIdentifiers();
        }
        doomed.push_back(identifier);
        for (const std::string& each : doomed) {
            BTHErrorRef error = setCodeSigningDictionaryValues({nullptr}, {each});
            if (error)
                BTHLogError("Failed to clear entitlements for %@ : %llu", each, error->code64());
        }
    });
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

}  // namespace berth
