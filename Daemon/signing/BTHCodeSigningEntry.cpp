#include "BTHCodeSigningEntry.h"

#include <functional>

#include "core/Format.h"

namespace berth {

namespace {

constexpr const char* kCodeSigningInfoKey = "CodeSigningInfo";
constexpr const char* kChildBundleIdsKey = "ChildBundleIds";
constexpr const char* kInvalidKey = "Invalid";
constexpr const char* kPlaceholderKey = "Placeholder";
constexpr const char* kRegisteredByCallerKey = "RegisteredByCaller";
constexpr const char* kDataContainerClassKey = "DataContainerClass";

std::optional<Value> storedInfo(const Value& dictionary) {
    const Value* info = dictionary.find(kCodeSigningInfoKey);
    if (!info || !info->isDictionary()) return std::nullopt;
    return *info;
}

std::optional<std::vector<std::string>> storedChildren(const Value& dictionary) {
    const Value* list = dictionary.find(kChildBundleIdsKey);
    if (!list || !list->isArray()) return std::nullopt;
    std::vector<std::string> children;
    for (const Value& child : *list->arrayValue())
        if (const std::string* identifier = child.string()) children.push_back(*identifier);
    return children;
}

std::optional<Value> childrenValue(const std::optional<std::vector<std::string>>& children) {
    if (!children) return std::nullopt;
    Value list = Value::array();
    for (const std::string& child : *children) list.push(child);
    return list;
}

// Order matters (the list is in insertion order), so each element is folded
// into the running hash. An empty list still hashes apart from an absent one.
size_t childrenHash(const std::optional<std::vector<std::string>>& children) {
    if (!children) return 0;
    size_t seed = 0x9e3779b97f4a7c15ull;
    for (const std::string& child : *children)
        seed ^= std::hash<std::string>()(child) + 0x9e3779b97f4a7c15ull + (seed << 6) + (seed >> 2);
    return seed;
}

char flag(bool on) {
    return on ? 'Y' : 'N';
}

}  // namespace

bool BTHTruthValue(const Value* value) {
    if (!value) return false;
    if (const bool* b = value->boolValue()) return *b;
    if (value->isInteger()) return *value->uint64Value() != 0;
    if (value->isNumber()) return *value->doubleValue() != 0;
    return false;
}

BTHCodeSigningEntry::BTHCodeSigningEntry(std::optional<Value> codeSigningInfo,
                                         uint64_t dataContainerClass)
    : codeSigningInfo_(std::move(codeSigningInfo)), dataContainerClass_(dataContainerClass) {}

BTHCodeSigningEntry BTHCodeSigningEntry::fromSerializedDictionary(const Value& dictionary) {
    BTHCodeSigningEntry entry(storedInfo(dictionary), 0);
    entry.childBundleIdentifiers_ = storedChildren(dictionary);
    entry.invalid_ = BTHTruthValue(dictionary.find(kInvalidKey));
    entry.placeholder_ = BTHTruthValue(dictionary.find(kPlaceholderKey));
    entry.registeredByCaller_ = BTHTruthValue(dictionary.find(kRegisteredByCallerKey));
    const Value* containerClass = dictionary.find(kDataContainerClassKey);
    if (containerClass && containerClass->isNumber())
        entry.dataContainerClass_ = *containerClass->uint64Value();
    return entry;
}

Value BTHCodeSigningEntry::serialize() const {
    Value dictionary = Value::dictionary();
    if (codeSigningInfo_) dictionary.set(kCodeSigningInfoKey, *codeSigningInfo_);
    if (std::optional<Value> children = childrenValue(childBundleIdentifiers_))
        dictionary.set(kChildBundleIdsKey, std::move(*children));
    dictionary.set(kInvalidKey, invalid_);
    dictionary.set(kPlaceholderKey, placeholder_);
    dictionary.set(kRegisteredByCallerKey, registeredByCaller_);
    dictionary.set(kDataContainerClassKey, dataContainerClass_);
    return dictionary;
}

const Value* BTHCodeSigningEntry::entitlements() const {
    if (!codeSigningInfo_) return nullptr;
    const Value* entitlements = codeSigningInfo_->find(kBTHEntitlementsKey);
    return entitlements && entitlements->isDictionary() ? entitlements : nullptr;
}

bool operator==(const BTHCodeSigningEntry& a, const BTHCodeSigningEntry& b) {
    if (&a == &b) return true;
    return a.codeSigningInfo_ == b.codeSigningInfo_ &&
           a.childBundleIdentifiers_ == b.childBundleIdentifiers_ && a.invalid_ == b.invalid_ &&
           a.placeholder_ == b.placeholder_ && a.registeredByCaller_ == b.registeredByCaller_ &&
           a.dataContainerClass_ == b.dataContainerClass_;
}

size_t BTHCodeSigningEntry::hash() const {
    size_t value =
        (codeSigningInfo_ ? codeSigningInfo_->hash() : 0) ^ childrenHash(childBundleIdentifiers_);
    if (invalid_) value += 2;
    if (placeholder_) value += 4;
    if (registeredByCaller_) value += 8;
    if (dataContainerClass_ != 0) value += 16;
    return value;
}

std::string BTHCodeSigningEntry::description() const {
    return format(
        "<%@ invalid: %c, placeholder: %c, regByCaller: %c, dataClass: %llu, childBundles: %@, "
        "CSinfo: %@>",
        "BTHCodeSigningEntry", flag(invalid_), flag(placeholder_), flag(registeredByCaller_),
        dataContainerClass_, childrenValue(childBundleIdentifiers_), codeSigningInfo_);
}

}  // namespace berth
