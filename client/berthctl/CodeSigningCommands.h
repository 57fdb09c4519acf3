// The code-signing subcommands of berthctl: "codesign process" (18) records an
// identifier's code-signing information as the installer reports it,
// "codesign get" (19) prints what is recorded, "codesign invalidate" (20)
// invalidates what belongs to no installed bundle.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <iosfwd>
#include <optional>
#include <string>

namespace berth::ctl {

enum class CodeSigningAction { Process, Get, Invalidate };

struct CodeSigningCommandOptions {
    CodeSigningAction action = CodeSigningAction::Get;
    std::string identifier;  // process and get
    // process: the information as a typed JSON dictionary, or, with
    // `entitlements`, just its entitlements; empty removes the identifier.
    std::string info;
    bool entitlements = false;
    std::optional<uint64_t> dataContainerClass;
    std::optional<std::string> parent;
    bool placeholder = false;

    std::filesystem::path socket;
    std::chrono::milliseconds timeout{30000};
    bool json = false;
};

int runCodeSigningCommand(const CodeSigningCommandOptions& options, std::ostream& out,
                          std::ostream& err);

}  // namespace berth::ctl
