// berth-launch: starts a program as an application, the way the system's
// launcher does. As root it asks the daemon's upcall for the application's
// directories (creating them on demand), places a child in the
// application's launch cgroup, refuses if the application is held
// terminated, and runs the program in a bubblewrap sandbox as the persona's
// user with only the application's containers visible.
#pragma once

#include <iosfwd>
#include <string>
#include <vector>

#include "upcall/BerthUpcall.h"

namespace berth::launch {

// Exit statuses of the launcher itself; otherwise it exits with the
// program's status (128 + the signal that ended it).
inline constexpr int kExitUsage = 64;
inline constexpr int kExitLaunchFailed = 125;
inline constexpr int kExitNotExecutable = 126;
inline constexpr int kExitNotFound = 127;

struct LaunchOptions {
    upcall::Request request;  // the identifier, persona, type, groups
    std::string socket;       // empty: the daemon's upcall socket
    std::vector<std::string> program;
};

// Launches and waits for the program. Messages go to `err`.
int runLaunch(const LaunchOptions& options, std::ostream& err);

// Inside the sandbox: becomes `uid`/`gid` for good and executes `program`.
// Returns only on failure, with the exit status.
int runAsPersona(uid_t uid, gid_t gid, const std::vector<std::string>& program, std::ostream& err);

}  // namespace berth::launch
