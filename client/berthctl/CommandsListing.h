// "berthctl commands": the daemon's 30 commands, by number, with the
// entitlement each one requires of its caller.
#pragma once

#include <iosfwd>

namespace berth::ctl {

// Prints the command table: an aligned table, or with `json` an array of
// {"command", "name", "entitlement", "repliesAtOnce"} objects.
int runListCommands(bool json, std::ostream& out);

}  // namespace berth::ctl
