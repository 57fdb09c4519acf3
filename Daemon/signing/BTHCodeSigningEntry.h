// BTHCodeSigningEntry: what the daemon remembers of one identifier's code
// signing: the reported information (whose "sys.kelp.Berth.Entitlements"
// holds its entitlements), the identifiers registered as its children, its
// flags and the class of its data container.
//
// Stored form (a property-list dictionary):
//   "CodeSigningInfo"     dictionary  (left out when absent)
//   "ChildBundleIds"      array of strings (left out when absent)
//   "Invalid", "Placeholder", "RegisteredByCaller"   booleans, always
//   "DataContainerClass"  unsigned integer, always
//
// An absent child list and an empty one are different values: they are
// stored differently and never compare equal.
//
// Reading is lenient, since the file is the daemon's own and a damaged key
// must not cost the whole record: a key of the wrong type reads as absent,
// false or 0, and a child list keeps only its strings. The flags accept any
// truth value (see BTHTruthValue).
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "core/Value.h"

namespace berth {

inline constexpr const char* kBTHEntitlementsKey = "sys.kelp.Berth.Entitlements";

// The truth value of a stored flag or an entitlement: a boolean is itself, a
// number (integer or real) is true when it is not zero. Everything else -
// absent, strings (even "YES" or "1"), data, dates, collections - is false,
// so that only a value meant as a truth value can grant anything.
bool BTHTruthValue(const Value* value);

class BTHCodeSigningEntry {
  public:
    // A blank entry: every field absent, false or 0.
    BTHCodeSigningEntry() = default;
    // `codeSigningInfo` must be a dictionary when present.
    BTHCodeSigningEntry(std::optional<Value> codeSigningInfo, uint64_t dataContainerClass);

    // Reads the stored form; a missing key gives an absent field, false or 0.
    static BTHCodeSigningEntry fromSerializedDictionary(const Value& dictionary);
    Value serialize() const;

    const std::optional<Value>& codeSigningInfo() const { return codeSigningInfo_; }
    void setCodeSigningInfo(std::optional<Value> info) { codeSigningInfo_ = std::move(info); }
    const std::optional<std::vector<std::string>>& childBundleIdentifiers() const {
        return childBundleIdentifiers_;
    }
    void setChildBundleIdentifiers(std::optional<std::vector<std::string>> children) {
        childBundleIdentifiers_ = std::move(children);
    }
    bool isInvalid() const { return invalid_; }
    void setInvalid(bool invalid) { invalid_ = invalid; }
    bool isPlaceholder() const { return placeholder_; }
    void setPlaceholder(bool placeholder) { placeholder_ = placeholder; }
    bool isRegisteredByCaller() const { return registeredByCaller_; }
    void setRegisteredByCaller(bool registered) { registeredByCaller_ = registered; }
    uint64_t dataContainerClass() const { return dataContainerClass_; }
    void setDataContainerClass(uint64_t containerClass) { dataContainerClass_ = containerClass; }

    // The entitlements dictionary inside the code-signing information, or
    // null.
    const Value* entitlements() const;

    // Deep equality of every field.
    friend bool operator==(const BTHCodeSigningEntry& a, const BTHCodeSigningEntry& b);
    // hash(info) ^ hash(children), plus 2 / 4 / 8 for the three flags and 16
    // for a non-zero class. Equal entries hash equally.
    size_t hash() const;
    // For log lines: "<BTHCodeSigningEntry invalid: N, placeholder: N,
    // regByCaller: N, dataClass: 0, childBundles: ..., CSinfo: ...>", flags as
    // 'Y' or 'N', an absent field as "(null)".
    std::string description() const;

  private:
    std::optional<Value> codeSigningInfo_;
    std::optional<std::vector<std::string>> childBundleIdentifiers_;
    bool invalid_ = false;
    bool placeholder_ = false;
    bool registeredByCaller_ = false;
    uint64_t dataContainerClass_ = 0;
};

using BTHCodeSigningEntryRef = std::shared_ptr<BTHCodeSigningEntry>;

}  // namespace berth
