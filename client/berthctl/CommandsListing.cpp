#include "CommandsListing.h"

#include <iomanip>
#include <iostream>
#include <string>

#include "ExitStatus.h"
#include "core/Commands.h"
#include "core/ValueJson.h"

namespace berth::ctl {

namespace {

size_t widestName() {
    size_t width = 0;
    for (const auto& row : BTHCommands()) width = std::max(width, std::string(row.name).size());
    return width;
}

}  // namespace

int runListCommands(bool json, std::ostream& out) {
    if (json) {
        Value rows = Value::array();
        for (const auto& row : BTHCommands()) {
            Value value = Value::dictionary();
            value.set("command", row.command);
            value.set("name", row.name);
            value.set("entitlement", row.requiredEntitlement);
            value.set("repliesAtOnce", row.repliesAtOnce != 0);
            rows.push(std::move(value));
        }
        out << valueToJson(rows) << "\n";
        return kExitSuccess;
    }
    // ".none" is no entitlement anybody holds: those commands are open to all.
    const int nameWidth = static_cast<int>(widestName());
    out << std::left << std::setw(4) << "No." << std::setw(nameWidth + 2) << "Command"
        << "Required entitlement\n";
    for (const auto& row : BTHCommands()) {
        const std::string entitlement = row.requiredEntitlement;
        out << std::left << std::setw(4) << row.command << std::setw(nameWidth + 2) << row.name
            << (entitlement == kBTHEntitlementNone ? "(any caller)" : entitlement) << "\n";
    }
    return kExitSuccess;
}

}  // namespace berth::ctl
