// The group and system container subcommands of berthctl: "groups" (13),
// "group-identifiers" (14), "system-container" (15), "system-groups" (16) and
// "system-group" (17), each one request of the daemon.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>
#include <optional>
#include <string>

namespace berth::ctl {

enum class GroupAction {
    Groups,            // command 13: group -> path of the application groups
    GroupIdentifiers,  // command 14: the application group identifiers
    SystemContainer,   // command 15: the system container's path
    SystemGroups,      // command 16: group -> path of the system groups
    SystemGroup,       // command 17: one system group's path
};

struct GroupOptions {
    GroupAction action = GroupAction::Groups;
    // Absent: the caller's own identifier.
    std::optional<std::string> identifier;
    // Commands 13 and 14; 1 is the caller's own user.
    uint64_t user = 1;
    // Command 17: the system group ("systemgroup.…").
    std::string group;

    // Empty: the daemon's request socket under the device root.
    std::filesystem::path socket;
    std::chrono::milliseconds timeout{30000};
    bool json = false;
};

// Runs the action and prints its result on `out`: "GROUP  PATH" lines, one
// identifier or path a line, or one line of JSON with `json`. Returns the
// exit status (ExitStatus.h).
int runGroupCommand(const GroupOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
