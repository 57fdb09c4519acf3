#include "BTHWhitelist.h"

#include <utility>

#include "core/BTHContainerClass.h"

namespace berth {

namespace {

BTHWhitelist::Mapping builtInSystemWhitelist() {
    return {
        {"sys.kelp.lanternd", "sys.kelp.lanternd"},
        {"sys.kelp.quarryd", "sys.kelp.quarryd"},
    };
}

BTHWhitelist::Mapping builtInSystemGroupWhitelist() {
    return {
        {"systemgroup.sys.kelp.tidewater", "systemgroup.sys.kelp.tidewater"},
        {"systemgroup.sys.kelp.marlin.tally", "systemgroup.sys.kelp.marlin.tally"},
        {"systemgroup.sys.kelp.kestrel.store", "systemgroup.sys.kelp.kestrel.store"},
        {"systemgroup.sys.kelp.beacon.managed", "systemgroup.sys.kelp.beacon.managed"},
        {"systemgroup.sys.kelp.quarryresources", "systemgroup.sys.kelp.quarryresources"},
    };
}

std::optional<std::string> lookUp(const BTHWhitelist::Mapping& mapping,
                                  const std::string& identifier) {
    auto it = mapping.find(identifier);
    if (it == mapping.end()) return std::nullopt;
    return it->second;
}

std::vector<std::string> identifiersOf(const BTHWhitelist::Mapping& mapping) {
    std::vector<std::string> identifiers;
    identifiers.reserve(mapping.size());
    for (const auto& entry : mapping) identifiers.push_back(entry.first);
    return identifiers;
}

}  // namespace

const BTHWhitelist& BTHWhitelist::sharedWhitelist() {
    // Made once, safely against concurrent first calls; never changed after.
    static const BTHWhitelist shared(builtInSystemWhitelist(), builtInSystemGroupWhitelist());
    return shared;
}

BTHWhitelist::BTHWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping)
    : systemWhitelist_(std::move(systemContainerMapping)),
      systemGroupWhitelist_(std::move(systemGroupContainerMapping)) {}

std::optional<std::string> BTHWhitelist::wellknownSystemContainerForId(
    const std::string& identifier) const {
    return lookUp(systemWhitelist_, identifier);
}

bool BTHWhitelist::systemContainerIdIsWellknown(const std::string& identifier) const {
    return systemWhitelist_.contains(identifier);
}

std::vector<std::string> BTHWhitelist::wellknownSystemContainers() const {
    return identifiersOf(systemWhitelist_);
}

std::optional<std::string> BTHWhitelist::wellknownSystemGroupContainerForId(
    const std::string& identifier) const {
    return lookUp(systemGroupWhitelist_, identifier);
}

bool BTHWhitelist::systemGroupContainerIdIsWellknown(const std::string& identifier) const {
    return systemGroupWhitelist_.contains(identifier);
}

std::vector<std::string> BTHWhitelist::wellknownSystemGroupContainers() const {
    return identifiersOf(systemGroupWhitelist_);
}

bool BTHWhitelist::containerIdIsWellknown(const std::string& identifier,
                                          uint64_t containerClass) const {
    if (containerClass == BTHContainerClassSharedSystemGroup)
        return systemGroupContainerIdIsWellknown(identifier);
    if (containerClass == BTHContainerClassDataSystem)
        return systemContainerIdIsWellknown(identifier);
    return false;
}

std::optional<std::string> BTHWhitelist::wellknownContainerForId(const std::string& identifier,
                                                                 uint64_t containerClass) const {
    if (containerClass == BTHContainerClassSharedSystemGroup)
        return wellknownSystemGroupContainerForId(identifier);
    if (containerClass == BTHContainerClassDataSystem)
        return wellknownSystemContainerForId(identifier);
    return std::nullopt;
}

}  // namespace berth
