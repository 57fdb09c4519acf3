// "berthctl sign": the administrator's hand on the code-signing registry,
// which tells the daemon who a calling program is and what it may do.
#pragma once

#include <filesystem>
#include <iosfwd>
#include <string>

namespace berth::ctl {

struct SignOptions {
    enum class Action { Sign, Remove, List };
    Action action = Action::Sign;
    std::filesystem::path executable;  // Sign, Remove; relative to the working directory
    std::string unit;                  // Sign, Remove: a unit instead of an executable
    std::string identifier;            // Sign
    std::string entitlements = "{}";   // Sign: typed JSON, must be a dictionary
    bool json = false;
};

// Performs the action on the registry of the device root and reports it on
// `out`. Signing and removing change a root-owned store: they are refused
// with kExitFailure for any other user before anything is touched. Returns
// the exit status (ExitStatus.h).
int runSign(const SignOptions& options, std::ostream& out, std::ostream& err);

}  // namespace berth::ctl
