// "berthctl usage" (command 23): the bytes a container's files occupy; and
// "berthctl protect" (command 21): moving a data container's user data to
// another protection class. Both find the container by identifier when its
// UUID is not given.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>
#include <optional>
#include <string>

namespace berth::ctl {

struct UsageOptions {
    enum class Action { Usage, Protect };
    Action action = Action::Usage;
    // A number 1-13 or a class name, as parseContainerClass reads it.
    std::string containerClass;
    uint64_t user = 1;  // 1 is the caller's own user
    // Absent: the caller's own identifier.
    std::optional<std::string> identifier;
    // usage: canonical UUID text, or empty to look the container up.
    std::string uuid;

    // protect: the class to apply, whether the app is a third party's, and
    // whether to wait for the next unlock when the device is locked (then
    // the reply, and this command, may take until someone unlocks).
    int32_t protectionClass = 0;
    bool thirdParty = false;
    bool wait = false;

    std::filesystem::path socket;  // empty: the daemon's
    std::chrono::milliseconds timeout{30000};
    bool json = false;
};

// Runs the command and prints its result. Returns the exit status
// (ExitStatus.h).
int runUsageCommand(const UsageOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
