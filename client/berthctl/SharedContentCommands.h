// The shared-content subcommands of berthctl: "stage-shared" (26),
// "net-extension" (27), "assets path" (28) and "assets delete" (29), each
// one request of the daemon.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>
#include <string>

namespace berth::ctl {

enum class SharedContentAction {
    StageShared,   // command 26: move an item inside a system-group container
    NetExtension,  // command 27: a network plug-in's container for the agent
    AssetsPath,    // command 28: the app's user-managed assets directory
    AssetsDelete,  // command 29: one item of it to death row
};

struct SharedContentOptions {
    SharedContentAction action = SharedContentAction::StageShared;
    // The system group (stage-shared) or the app or plug-in identifier.
    std::string identifier;
    // stage-shared: both relative to the container; assets delete: `source`
    // is relative to the assets directory.
    std::string source;
    std::string dest;
    // net-extension: a number or a class name, as parseContainerClass reads
    // it (2 or 6).
    std::string containerClass = "Data/VPNPlugin";

    std::filesystem::path socket;  // empty: the daemon's
    std::chrono::milliseconds timeout{30000};
    bool json = false;
};

// Runs the action and prints its result: the path, or a line saying what was
// done, or one line of JSON with `json`. Returns the exit status
// (ExitStatus.h).
int runSharedContentCommand(const SharedContentOptions& options, std::ostream& out,
                            std::ostream& err);

}  // namespace berth::ctl
