// berth-launch: starts a program as an application (see Launch.h).
//
//   berth-launch --identifier ID --persona UID [--plugin] [--group ID ...]
//                [--system-container ID] [--system-group ID ...]
//                [--root R] [--socket PATH] -- PROGRAM [ARGS...]
//
// The device root is --root, else BERTH_ROOT (default /).
#include <CLI/CLI.hpp>
#include <cstdlib>
#include <iostream>
#include <string>
#include <vector>

#include "Launch.h"

namespace {

using namespace berth::launch;

// The sandbox's first step, run by the launcher's own program inside it:
// --as-persona UID GID -- PROGRAM [ARGS...]
int asPersona(const std::vector<std::string>& args) {
    if (args.size() < 5 || args[3] != "--")
        return std::cerr << "berth-launch: malformed --as-persona\n", kExitUsage;
    try {
        const uid_t uid = static_cast<uid_t>(std::stoul(args[1]));
        const gid_t gid = static_cast<gid_t>(std::stoul(args[2]));
        return runAsPersona(uid, gid, {args.begin() + 4, args.end()}, std::cerr);
    } catch (const std::exception&) {
        return std::cerr << "berth-launch: malformed --as-persona ids\n", kExitUsage;
    }
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<std::string> args(argv + 1, argv + argc);
    if (!args.empty() && args[0] == "--as-persona") return asPersona(args);

    std::vector<std::string> program;
    for (size_t i = 0; i < args.size(); ++i)
        if (args[i] == "--") {
            program.assign(args.begin() + i + 1, args.end());
            args.resize(i);
            break;
        }

    LaunchOptions options;
    berth::upcall::Request& request = options.request;
    std::string root;
    CLI::App app{
        "berth-launch: start a program as an application, in a sandbox that sees only its "
        "containers, as the persona's user (root only)",
        "berth-launch"};
    app.footer(
        "The program and its arguments follow \"--\": berth-launch [OPTIONS] -- PROGRAM [ARGS...]");
    app.add_option("--identifier", request.signingIdentifier, "The application's identifier")
        ->required();
    app.add_option("--persona", request.persona, "The user to run as and whose containers")
        ->required();
    app.add_flag("--plugin", request.plugin, "A plug-in (its data container is a plug-in's)");
    app.add_option("--group", request.groups, "An application group; repeat for more");
    app.add_option("--system-container", request.systemContainer,
                   "The system container's identifier");
    app.add_option("--system-group", request.systemGroups, "A system group; repeat for more");
    app.add_option("--root", root, "The device root (default: BERTH_ROOT, else /)");
    app.add_option("--socket", options.socket, "The upcall socket (default: the daemon's)");
    try {
        std::vector<std::string> reversed(args.rbegin(), args.rend());
        app.parse(reversed);
        if (program.empty()) throw CLI::ValidationError("program", "give -- PROGRAM [ARGS...]");
    } catch (const CLI::ParseError& e) {
        const int status = app.exit(e);
        return status == 0 ? 0 : kExitUsage;
    }
    if (!root.empty()) ::setenv("BERTH_ROOT", root.c_str(), 1);
    options.program = std::move(program);
    return runLaunch(options, std::cerr);
}
