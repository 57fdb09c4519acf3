// The maintenance subcommands of berthctl: "migrate" (command 24) and
// "retry-test" (command 25), which repeats its request across the daemon's
// deliberate exits as every client of the daemon is expected to.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>

namespace berth::ctl {

enum class MaintenanceAction {
    Migrate,    // command 24: the data migration
    RetryTest,  // command 25, repeated until it succeeds
};

struct MaintenanceOptions {
    MaintenanceAction action = MaintenanceAction::Migrate;
    uint32_t user = 1;     // retry-test: 1 is the caller's own user
    uint64_t crashes = 2;  // retry-test: exits asked of the daemon
    // retry-test: how long to wait for the daemon to come back after each exit.
    std::chrono::milliseconds reconnectWait{30000};

    std::filesystem::path socket;  // empty: the daemon's
    std::chrono::milliseconds timeout{300000};
    bool json = false;
};

// Runs the action and prints what happened ("data migration done", or how
// many times the daemon exited before the retry test succeeded), or one line
// of JSON with `json`. Returns the exit status (ExitStatus.h).
int runMaintenanceCommand(const MaintenanceOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
