// The container subcommands of berthctl: "create", "lookup", "list",
// "info get|set|remove", "metadata", "recreate-structure", "replace",
// "stage-delete", "empty-death-row", "regenerate", "delete" and "wipe", each
// one request of the daemon (preceded by a look-up for every container whose
// UUID is needed but was not given), with typed arguments and readable
// output.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "libberth/BerthContainers.h"

namespace berth::ctl {

enum class ContainerAction {
    Create,             // command 0, creating when missing
    Lookup,             // command 0, never creating
    List,               // command 1
    InfoGet,            // command 6
    InfoSet,            // command 5
    InfoRemove,         // command 5 without a value
    Metadata,           // command 7
    RecreateStructure,  // command 8 or 22
    Replace,            // command 2
    StageDelete,        // command 3
    EmptyDeathRow,      // command 4
    Regenerate,         // command 9
    Delete,             // command 10
    Wipe,               // command 12, or 11 with `plugin`
};

struct ContainerOptions {
    ContainerAction action = ContainerAction::Lookup;
    // As given: a number 1-13 or a class name such as "Data/Application".
    // For replace, this and the four fields after it describe the new
    // container.
    std::string containerClass;
    // 1 is the caller's own user.
    uint64_t user = 1;
    // Absent: the caller's own identifier for create and lookup; for the
    // other commands the daemon gets none.
    std::optional<std::string> identifier;
    // Canonical UUID text, or empty; given, it needs an identifier too. The
    // commands that address one existing container look it up first
    // (command 0, never creating) when empty. That look-up only ever finds
    // a permanent container: a transient one must be given by UUID.
    std::string uuid;
    // Sent by create, lookup, list and delete; the other commands ignore it.
    bool transient = false;

    std::string key;    // info get, set and remove
    std::string value;  // info set: typed JSON
    bool withInfo = false;
    uint64_t recreateCommand = 8;  // 8 or 22

    // replace: the old container, present when `oldIdentifier` is. Its class
    // and user default to those of the new container; its UUID, when empty,
    // is looked up like the new container's.
    std::optional<std::string> oldIdentifier;
    std::string oldUuid;
    std::string oldClass;
    std::optional<uint64_t> oldUser;

    // stage-delete: the containers, each "CLASS:USER:IDENTIFIER[:UUID]".
    std::vector<std::string> staged;

    // wipe: command 11, which means class 4; `containerClass` must be empty.
    bool plugin = false;

    // Empty: the daemon's request socket under the device root.
    std::filesystem::path socket;
    std::chrono::milliseconds timeout{30000};
    bool json = false;
};

// A container class from the command line: its number (1-13) or its name,
// in any letter case ("data/application"). Nullopt, with the reason in
// `why`, for anything else, including the invalid classes 0 and 14.
std::optional<uint64_t> parseContainerClass(std::string_view text, std::string* why);

// One container of stage-delete: "CLASS:USER:IDENTIFIER" or
// "CLASS:USER:IDENTIFIER:UUID", CLASS as for parseContainerClass and USER a
// 32-bit user id. With four or more fields the last is the UUID, so an
// identifier holding a colon needs its UUID given. Nullopt, with the reason,
// for anything else.
std::optional<ContainerSelector> parseContainerEntry(std::string_view text, std::string* why);

// Runs the action and prints its result on `out` (human-readable, or one
// line of JSON with `json`). Returns the exit status (ExitStatus.h): a reply
// error prints "error: <name> (<code>): <text>" on `err` and fails; bad
// arguments are usage errors; a daemon that cannot be asked is a transport
// error.
int runContainerCommand(const ContainerOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
