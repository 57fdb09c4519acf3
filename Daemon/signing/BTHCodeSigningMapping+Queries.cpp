// What the rest of the daemon asks the code-signing store: an identifier's
// information and entitlements, its groups and system groups, its system
// container and data container class. An identifier that the mapping does
// not know but whose bundle container carries information cached by the
// installer is moved into the mapping on its first query.
#include <algorithm>

#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHLog.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

// The entitlement key inside information cached by the installer.
constexpr const char* kCachedEntitlementsKey = "Entitlements";

// A group identifier must name one directory entry of a class directory's
// world: anything that could be read as a path, or is empty, or is longer
// than a file name can be, is refused.
constexpr size_t kMaxGroupIdentifierLength = 255;
// More groups than any installed item has; a list beyond it is forged.
constexpr size_t kMaxGroupsPerEntitlement = 1000;

bool usableGroupIdentifier(const std::string& group) {
    if (group.empty() || group.size() > kMaxGroupIdentifierLength) return false;
    if (group == "." || group == "..") return false;
    return std::none_of(group.begin(), group.end(), [](char c) {
        return c == '/' || static_cast<unsigned char>(c) < 0x20 || c == 0x7f;
    });
}

// The group list of one entitlement: a list of strings or a single string;
// duplicates dropped, the first occurrence's order kept. Anything else, a
// list holding anything but usable identifiers, or an oversized list, is
// ignored with a log line.
std::optional<std::vector<std::string>> copyApplicationGroupEntitlement(
    const std::string& identifier, const Value* entitlements, const char* key) {
    BTH_FUNCTION(
        "-[BTHCodeSigningMapping "
        "_copyApplicationGroupEntitlementForIdentifier:entitlements:groupKey:]");
    const Value* value = entitlements ? entitlements->find(key) : nullptr;
    if (!value) return std::nullopt;
    std::vector<std::string> groups;
    if (const Value::Array* list = value->arrayValue()) {
        if (!std::all_of(list->begin(), list->end(), [](const Value& v) { return v.isString(); })) {
            BTHLogError("Entitlement %@ for %@ contains non-string values; ignoring.", key,
                        identifier);
            return std::nullopt;
        }
        if (list->size() > kMaxGroupsPerEntitlement) {
            BTHLogError("Entitlement %@ for %@ lists %zu groups, more than %zu; ignoring.", key,
                        identifier, list->size(), kMaxGroupsPerEntitlement);
            return std::nullopt;
        }
        for (const Value& group : *list) groups.push_back(*group.string());
    } else if (const std::string* single = value->string()) {
        groups.push_back(*single);
    } else {
        BTHLogError("Entitlement %@ for %@ does not contain supported types; ignoring.", key,
                    identifier);
        return std::nullopt;
    }
    std::vector<std::string> unique;
    for (std::string& group : groups) {
        if (!usableGroupIdentifier(group)) {
            BTHLogError(
                "Entitlement %@ for %@ names the unusable group identifier %@; ignoring it.", key,
                identifier, group);
            continue;
        }
        if (std::find(unique.begin(), unique.end(), group) == unique.end())
            unique.push_back(std::move(group));
    }
    return unique;
}

bool noGroups(const std::optional<std::vector<std::string>>& groups) {
    return !groups || groups->empty();
}

}  // namespace

Value BTHStringListValue(const std::vector<std::string>& list) {
    Value value = Value::array();
    for (const std::string& each : list) value.push(each);
    return value;
}

std::optional<std::vector<std::string>> BTHGroupListOfEntitlements(const std::string& identifier,
                                                                   const Value* entitlements,
                                                                   const char* key,
                                                                   const char* fallBackKey) {
    std::optional<std::vector<std::string>> groups =
        copyApplicationGroupEntitlement(identifier, entitlements, key);
    if (fallBackKey && noGroups(groups))
        groups = copyApplicationGroupEntitlement(identifier, entitlements, fallBackKey);
    return groups;
}

const BTHCodeSigningEntry* BTHCodeSigningMapping::migrateCachedCodeSigningInfo(
    const std::string& identifier) {
    BTH_FUNCTION("-[BTHCodeSigningMapping _onQueue_codeSigningInfoForIdentifier:externalRequest:]");
    const BTHMetadataRef bundle = BTHContainerCache::sharedInstance().containerForUser(
        kBTHBundleUserId, BTHContainerClassBundleApplication, identifier, false, nullptr);
    if (!bundle || !bundle->info()) return nullptr;
    const Value* cached = bundle->info()->find(kBTHCachedCodeSigningInfoKey);
    if (!cached || !cached->isDictionary()) return nullptr;
    BTHLogNotice("Migrating code signing info from bundle container upon request for %@",
                 bundle->identifier());
    Value info = *cached;
    const Value* entitlements = cached->find(kCachedEntitlementsKey);
    info.set(kBTHEntitlementsKey, entitlements ? *entitlements : Value());
    auto entry =
        std::make_shared<BTHCodeSigningEntry>(std::move(info), BTHContainerClassDataApplication);
    codeSigningMappingDict_[bundle->identifier()] = entry;
    if (BTHErrorRef error = writeCodeSigningMappingToDisk())
        BTHLogError(
            "Failed to write code signing mapping to disk during current identifier migration of "
            "%@: %@",
            identifier, error);
    return entry.get();
}

std::optional<Value> BTHCodeSigningMapping::onQueueCodeSigningInfoForIdentifier(
    const std::string& identifier, bool externalRequest) {
    const BTHCodeSigningEntry* entry = storedEntry(identifier);
    if (externalRequest && entry && (entry->isPlaceholder() || entry->isInvalid()))
        return std::nullopt;
    if (!entry) entry = migrateCachedCodeSigningInfo(identifier);
    return entry ? entry->codeSigningInfo() : std::nullopt;
}

const Value* BTHCodeSigningMapping::onQueueEntitlementsForIdentifier(
    const std::string& identifier) {
    const BTHCodeSigningEntry* entry = storedEntry(identifier);
    if (!entry) entry = migrateCachedCodeSigningInfo(identifier);
    return entry ? entry->entitlements() : nullptr;
}

std::optional<std::vector<std::string>> BTHCodeSigningMapping::onQueueSystemGroupIdentifiers(
    const std::string& identifier) {
    BTH_FUNCTION("-[BTHCodeSigningMapping systemGroupIdentifiersForIdentifier:]");
    std::optional<std::vector<std::string>> groups = BTHGroupListOfEntitlements(
        identifier, onQueueEntitlementsForIdentifier(identifier), kBTHSystemGroupsEntitlement,
        kBTHSystemGroupContainersEntitlement);
    if (!groups) return groups;
    std::erase_if(*groups, [](const std::string& group) {
        if (group.starts_with(kBTHSystemGroupPrefix)) return false;
        BTHLogError("System group ID %@ does not have proper prefix, ignoring.", group);
        return true;
    });
    return groups;
}

std::optional<Value> BTHCodeSigningMapping::getCodeSigningInfoForIdentifier(
    const std::string& identifier) {
    return lockingAll([&] { return onQueueCodeSigningInfoForIdentifier(identifier, true); });
}

bool BTHCodeSigningMapping::codeSigningInfoExistForIdentifier(const std::string& identifier) {
    return onCodeSignQueue(
        [&] { return onQueueCodeSigningInfoForIdentifier(identifier, false).has_value(); });
}

bool BTHCodeSigningMapping::identifierHasSystemContainer(const std::string& identifier) {
    return onCodeSignQueue([&] {
        const Value* entitlements = onQueueEntitlementsForIdentifier(identifier);
        return entitlements && BTHTruthValue(entitlements->find(kBTHSystemContainerEntitlement));
    });
}

uint64_t BTHCodeSigningMapping::dataContainerTypeForIdentifier(const std::string& identifier) {
    return onCodeSignQueue([&] {
        const BTHCodeSigningEntry* entry = storedEntry(identifier);
        return entry ? entry->dataContainerClass() : uint64_t{0};
    });
}

bool BTHCodeSigningMapping::identifierHasCallerRegisteredEntitlements(
    const std::string& identifier) {
    return onCodeSignQueue([&] {
        const BTHCodeSigningEntry* entry = storedEntry(identifier);
        return entry && entry->isRegisteredByCaller();
    });
}

std::optional<std::vector<std::string>> BTHCodeSigningMapping::appGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    return onCodeSignQueue([&] {
        return BTHGroupListOfEntitlements(identifier, onQueueEntitlementsForIdentifier(identifier),
                                          kBTHApplicationGroupsEntitlement, nullptr);
    });
}

std::optional<std::vector<std::string>> BTHCodeSigningMapping::systemGroupIdentifiersForIdentifier(
    const std::string& identifier) {
    return onCodeSignQueue([&] { return onQueueSystemGroupIdentifiers(identifier); });
}

void BTHCodeSigningMapping::iterateGroupIdsWithKey(
    const char* key, const char* fallBackKey,
    const std::function<void(const std::string&, const std::optional<std::vector<std::string>>&)>&
        block) {
    for (const auto& [identifier, entry] : codeSigningMappingDict_) {
        const Value* entitlements = entry ? entry->entitlements() : nullptr;
        block(identifier, BTHGroupListOfEntitlements(identifier, entitlements, key, fallBackKey));
    }
}

}  // namespace berth
