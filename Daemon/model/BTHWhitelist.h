// BTHWhitelist: the well-known system containers (class 12) and system group
// containers (class 13), whose directories other software expects at a fixed
// path. Each table maps an identifier to the directory name its container
// gets in place of a UUID. The shared instance holds the built-in tables and
// never changes; safe from any thread.
#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

namespace berth {

class BTHWhitelist {
  public:
    using Mapping = std::map<std::string, std::string>;

    static const BTHWhitelist& sharedWhitelist();

    BTHWhitelist(Mapping systemContainerMapping, Mapping systemGroupContainerMapping);

    std::optional<std::string> wellknownSystemContainerForId(const std::string& identifier) const;
    bool systemContainerIdIsWellknown(const std::string& identifier) const;
    std::vector<std::string> wellknownSystemContainers() const;

    std::optional<std::string> wellknownSystemGroupContainerForId(
        const std::string& identifier) const;
    bool systemGroupContainerIdIsWellknown(const std::string& identifier) const;
    std::vector<std::string> wellknownSystemGroupContainers() const;

    // Class 12 asks the system table, class 13 the system group table; every
    // other class answers false / none.
    bool containerIdIsWellknown(const std::string& identifier, uint64_t containerClass) const;
    std::optional<std::string> wellknownContainerForId(const std::string& identifier,
                                                       uint64_t containerClass) const;

    const Mapping& systemWhitelist() const { return systemWhitelist_; }
    void setSystemWhitelist(Mapping mapping) { systemWhitelist_ = std::move(mapping); }
    const Mapping& systemGroupWhitelist() const { return systemGroupWhitelist_; }
    void setSystemGroupWhitelist(Mapping mapping) { systemGroupWhitelist_ = std::move(mapping); }

  private:
    Mapping systemWhitelist_;
    Mapping systemGroupWhitelist_;
};

}  // namespace berth
