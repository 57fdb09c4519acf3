// Processing reported code-signing information into an identifier's entry:
// its parent's child list, its data container class and flags, and what a
// change of its entitlements implies (its groups re-counted, a withdrawn
// system container staged for deletion). The file holds the new state before
// the caller hears of it.
#include <algorithm>

#include "BTHCodeSigningMapping.h"
#include "BTHContainerCache.h"
#include "BTHFaultInjection.h"
#include "BTHLog.h"
#include "BTHPropertyListFile.h"
#include "core/BTHContainerClass.h"

namespace berth {

namespace {

constexpr const char* kProcessFunction =
    "-[BTHCodeSigningMapping _onQueue_processCodeSigningInfo:forIdentifier:withOptions:]";

bool optionIsTrue(const std::optional<Value>& options, const char* key) {
    return options && BTHTruthValue(options->find(key));
}

}  // namespace

uint64_t BTHCodeSigningMapping::processCodeSigningInfo(const std::optional<Value>& reportedInfo,
                                                       const std::optional<std::string>& identifier,
                                                       const std::optional<Value>& options) {
    // The mapping holds what its file gives back, so a later start finds
    // exactly what this one kept.
    const std::optional<Value> info =
        reportedInfo ? std::optional<Value>(BTH_valueAsStored(*reportedInfo)) : std::nullopt;
    // Information that changes nothing (a caller's entitlements, refreshed on
    // each of its requests) needs neither the lock nor any container work.
    if (onCodeSignQueue([&] { return isUnchanged(info, identifier, options); }))
        return BTHErrorSuccess;
    return lockingAll([&] { return onQueueProcessCodeSigningInfo(info, identifier, options); });
}

namespace {

// A caller's entitlements as code-signing information, and its options.
std::pair<Value, Value> callerRegisteredInfo(const Value& entitlements) {
    Value info = Value::dictionary();
    info.set(kBTHEntitlementsKey, entitlements);
    Value options = Value::dictionary();
    options.set(kBTHRegByCallerOption, true);
    return {std::move(info), std::move(options)};
}

}  // namespace

uint64_t BTHCodeSigningMapping::processCallerRegisteredEntitlements(const Value& entitlements,
                                                                    const std::string& identifier) {
    auto [info, options] = callerRegisteredInfo(entitlements);
    return processCodeSigningInfo(info, identifier, options);
}

bool BTHCodeSigningMapping::callerEntitlementsNeedNoProcessing(const Value& entitlements,
                                                               const std::string& identifier) {
    if (knownToNeedNoProcessing(identifier, entitlements)) return true;
    return onCodeSignQueue([&] {
        bool unchanged = false;
        const BTHCodeSigningEntry* entry = storedEntry(identifier);
        if (!(entry && entry->isRegisteredByCaller())) {
            unchanged = onQueueCodeSigningInfoForIdentifier(identifier, false).has_value();
        } else {
            auto [info, options] = callerRegisteredInfo(entitlements);
            unchanged = isUnchanged(info, identifier, options);
        }
        // Read on the queue, after any change the look made itself.
        if (unchanged) rememberNeedsNoProcessing(identifier, entitlements, version_.load());
        return unchanged;
    });
}

bool BTHCodeSigningMapping::knownToNeedNoProcessing(const std::string& identifier,
                                                    const Value& entitlements) {
    std::lock_guard lock(noProcessingMutex_);
    const auto known = noProcessingNeeded_.find(identifier);
    return known != noProcessingNeeded_.end() && known->second.version == version_.load() &&
           known->second.entitlements == entitlements;
}

void BTHCodeSigningMapping::rememberNeedsNoProcessing(const std::string& identifier,
                                                      const Value& entitlements, uint64_t version) {
    // Bounded by the signed identifiers that connect; a flood of them only
    // starts the memory over.
    constexpr size_t kRemembered = 4096;
    std::lock_guard lock(noProcessingMutex_);
    if (noProcessingNeeded_.size() >= kRemembered) noProcessingNeeded_.clear();
    noProcessingNeeded_.insert_or_assign(identifier, NoProcessingNeeded{entitlements, version});
}

void BTHCodeSigningMapping::withdrawSystemContainer(const std::string& identifier) {
    BTH_FUNCTION(kProcessFunction);
    BTHErrorRef lookupError;
    const BTHMetadataRef container = BTHContainerCache::sharedInstance().containerForUser(
        kBTHSystemUserId, BTHContainerClassDataSystem, identifier, false, &lookupError);
    if (!container) {
        BTHLogError("Failed to retrieve system container %@: %@", identifier, lookupError);
        return;
    }
    BTHLogError("Deleting system container for ID: %@ because it is no longer in the entitlements",
                identifier);
    if (!hooks_.stageForDelete) return;
    const uint64_t code = hooks_.stageForDelete(kBTHSystemUserId, container->uuid(), identifier,
                                                container->containerClass());
    if (code != BTHErrorSuccess)
        BTHLogError("Failed to destroy system container with identifier %@: %llu", identifier,
                    code);
}

void BTHCodeSigningMapping::tellGroupManager(
    std::optional<std::vector<std::string>> oldGroups,
    const std::optional<std::vector<std::string>>& newGroups, BTHGroupType type) {
    if (!oldGroups && !newGroups) return;
    if (hooks_.groupContainerIdsChanged)
        hooks_.groupContainerIdsChanged(std::move(oldGroups), newGroups, type);
}

BTHCodeSigningMapping::PreparedEntry BTHCodeSigningMapping::prepareEntry(
    const std::optional<Value>& info, const std::string& identifier,
    const std::optional<Value>& options) const {
    BTH_FUNCTION(kProcessFunction);
    PreparedEntry prepared;
    prepared.entry = std::make_shared<BTHCodeSigningEntry>();
    BTHCodeSigningEntry& entry = *prepared.entry;
    const BTHCodeSigningEntry* old = storedEntry(identifier);
    const Value* dataClass = options ? options->find(kBTHDataContainerClassOption) : nullptr;
    entry.setDataContainerClass(dataClass ? dataClass->uint64Value().value_or(0) : 0);

    // Children whose entries have gone are dropped from the list.
    if (old && old->childBundleIdentifiers()) {
        std::vector<std::string> children = *old->childBundleIdentifiers();
        std::erase_if(children, [&](const std::string& c) { return !storedEntry(c); });
        entry.setChildBundleIdentifiers(std::move(children));
    }

    const Value* parentValue = options ? options->find(kBTHParentBundleIDOption) : nullptr;
    const std::string* parent = parentValue ? parentValue->string() : nullptr;
    if (parent && *parent == identifier) {
        BTHLogError("Ignoring %@ as its own parent", identifier);
    } else if (parent) {
        // The parent's entry changes as a copy that is staged, so the new
        // child list reaches the file with this processing; a parent without
        // entry stays unknown (its blank entry stores nothing).
        const BTHCodeSigningEntry* stored = storedEntry(*parent);
        std::vector<std::string> children = stored && stored->childBundleIdentifiers()
                                                ? *stored->childBundleIdentifiers()
                                                : std::vector<std::string>{};
        if (std::find(children.begin(), children.end(), identifier) == children.end()) {
            children.push_back(identifier);
            prepared.parent = stored ? std::make_shared<BTHCodeSigningEntry>(*stored)
                                     : std::make_shared<BTHCodeSigningEntry>();
            prepared.parent->setChildBundleIdentifiers(std::move(children));
            prepared.parentIdentifier = *parent;
        }
    }

    if (optionIsTrue(options, kBTHRegByCallerOption)) entry.setRegisteredByCaller(true);
    if (optionIsTrue(options, kBTHPlaceholderOption)) entry.setPlaceholder(true);
    entry.setCodeSigningInfo(info);
    prepared.changed = !old || !(*old == entry);
    return prepared;
}

bool BTHCodeSigningMapping::isUnchanged(const std::optional<Value>& info,
                                        const std::optional<std::string>& identifier,
                                        const std::optional<Value>& options) const {
    if (!identifier || !acceptable(info, options)) return false;
    try {
        const PreparedEntry prepared = prepareEntry(info, *identifier, options);
        return !prepared.changed && !prepared.parent;
    } catch (...) {
        return false;  // processing proper reports it
    }
}

bool BTHCodeSigningMapping::acceptable(const std::optional<Value>& info,
                                       const std::optional<Value>& options) {
    return (!info || info->isDictionary()) && (!options || options->isDictionary());
}

uint64_t BTHCodeSigningMapping::onQueueProcessCodeSigningInfo(
    const std::optional<Value>& info, const std::optional<std::string>& identifier,
    const std::optional<Value>& options) {
    BTH_FUNCTION(kProcessFunction);
    if (!identifier) return BTHErrorIdentifierMissing;
    if (!acceptable(info, options)) {
        BTHMakeError(BTHErrorInvalidArgument, nullptr,
                     "Can't act on an invalid object: ID: %@, info: %@, options: %@", identifier,
                     info ? kindName(info->kind()) : "(null)",
                     options ? kindName(options->kind()) : "(null)");
        return BTHErrorInvalidArgument;
    }

    std::vector<BTHCodeSigningEntryRef> staged;
    std::vector<std::string> stagedIdentifiers;
    BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&]() -> BTHErrorRef {
        PreparedEntry prepared = prepareEntry(info, *identifier, options);
        if (prepared.parent) {
            BTHLogDebug("Staging Child Bundles: %@ for parent ID: %@ by appending: %@",
                        BTHStringListValue(*prepared.parent->childBundleIdentifiers()),
                        prepared.parentIdentifier, *identifier);
            staged.push_back(prepared.parent);
            stagedIdentifiers.push_back(prepared.parentIdentifier);
        }
        if (!prepared.changed) return nullptr;

        const Value* entitlements = info ? info->find(kBTHEntitlementsKey) : nullptr;
        if (entitlements && !entitlements->isDictionary()) entitlements = nullptr;
        // Every read of the stored state below sees the old entry.
        const Value* oldEntitlements = onQueueEntitlementsForIdentifier(*identifier);
        if (oldEntitlements &&
            BTHTruthValue(oldEntitlements->find(kBTHSystemContainerEntitlement)) &&
            !(entitlements && BTHTruthValue(entitlements->find(kBTHSystemContainerEntitlement))))
            withdrawSystemContainer(*identifier);
        BTHCrashPoint("codesign.before-groups");
        tellGroupManager(BTHGroupListOfEntitlements(*identifier, oldEntitlements,
                                                    kBTHApplicationGroupsEntitlement, nullptr),
                         BTHGroupListOfEntitlements(*identifier, entitlements,
                                                    kBTHApplicationGroupsEntitlement, nullptr),
                         BTHGroupTypeApplication);
        tellGroupManager(
            onQueueSystemGroupIdentifiers(*identifier),
            BTHGroupListOfEntitlements(*identifier, entitlements, kBTHSystemGroupsEntitlement,
                                       kBTHSystemGroupContainersEntitlement),
            BTHGroupTypeSystem);
        BTHCrashPoint("codesign.after-groups");
        staged.push_back(info ? prepared.entry : std::make_shared<BTHCodeSigningEntry>());
        stagedIdentifiers.push_back(*identifier);
        return nullptr;
    });
    if (failure) return failure->code64();
    if (staged.empty()) return BTHErrorSuccess;
    if (BTHErrorRef error = setCodeSigningDictionaryValues(staged, stagedIdentifiers))
        return error->code64();
    BTHCrashPoint("codesign.after-write");
    return BTHErrorSuccess;
}

}  // namespace berth
