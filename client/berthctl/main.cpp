// berthctl: the command-line client of berthd. Sends raw requests to the
// daemon, runs its container commands with typed arguments, and does the
// administrator's local chores (signatures, lock state).
// Each subcommand lives in its own module; this file only reads the command
// line and hands over.
#include <CLI/CLI.hpp>
#include <cmath>
#include <iostream>
#include <vector>

#include "CommandsListing.h"
#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "LockCommand.h"
#include "SendCommand.h"
#include "SignCommand.h"

namespace {

using namespace berth::ctl;

struct Arguments {
    bool json = false;
    SendOptions send;
    double timeoutSeconds = 30;
    SignOptions sign;
    bool signRemove = false;
    bool signList = false;
    ContainerOptions container;
    uint32_t user = 1;
};

std::chrono::milliseconds timeoutOf(double seconds) {
    return std::chrono::milliseconds(std::max<long long>(1, std::llround(seconds * 1000)));
}

// The options the container subcommands share: which container, and how to
// reach the daemon.
void addContainerOptions(CLI::App* command, ContainerAction action, Arguments& args) {
    ContainerOptions& container = args.container;
    command
        ->add_option("--class", container.containerClass,
                     "Container class: 1-13 or a name such as Data/Application")
        ->required();
    command->add_option("--user", args.user, "User id; 1 (default) is your own user");
    if (action != ContainerAction::List)
        command->add_option_function<std::string>(
            "--identifier", [&container](const std::string& id) { container.identifier = id; },
            "Container identifier (default: your own)");
    if (action != ContainerAction::List && action != ContainerAction::Create &&
        action != ContainerAction::Lookup)
        command->add_option("--uuid", container.uuid,
                            "The container's UUID (default: looked up by identifier)");
    command->add_flag("--transient", container.transient, "A transient container");
    command->add_option("--socket", args.send.socket, "Request socket (default: the daemon's)");
    command->add_option("--timeout", args.timeoutSeconds, "Seconds to wait for a reply")
        ->check(CLI::PositiveNumber);
}

// Adds a container subcommand that runs `action`.
CLI::App* addContainerCommand(CLI::App& parent, const char* name, const char* description,
                              ContainerAction action, Arguments& args) {
    CLI::App* command = parent.add_subcommand(name, description);
    command->callback([&args, action] { args.container.action = action; });
    addContainerOptions(command, action, args);
    return command;
}

// Checks what CLI11 cannot: which positionals the chosen sign action needs.
void validateSign(Arguments& args) {
    if (args.signRemove && args.signList)
        throw CLI::ValidationError("sign", "--remove and --list exclude each other");
    SignOptions& sign = args.sign;
    sign.action = args.signList     ? SignOptions::Action::List
                  : args.signRemove ? SignOptions::Action::Remove
                                    : SignOptions::Action::Sign;
    const bool hasPath = !sign.executable.empty();
    const bool hasIdentifier = !sign.identifier.empty();
    switch (sign.action) {
        case SignOptions::Action::List:
            if (hasPath || hasIdentifier)
                throw CLI::ValidationError("sign", "--list takes no executable or identifier");
            break;
        case SignOptions::Action::Remove:
            if (!hasPath || hasIdentifier)
                throw CLI::ValidationError("sign", "--remove takes the executable alone");
            break;
        case SignOptions::Action::Sign:
            if (!hasPath || !hasIdentifier)
                throw CLI::ValidationError("sign", "give the executable and its identifier");
            break;
    }
}

}  // namespace

int main(int argc, char** argv) {
    Arguments args;
    CLI::App app{
        "berthctl: talk to berthd and administer its device root.\n"
        "The device root is BERTH_ROOT (default /)."};
    app.require_subcommand(1);
    app.fallthrough();
    app.add_flag("--json", args.json, "Print machine-readable JSON on one line");

    CLI::App* send =
        app.add_subcommand("send", "Send one request (typed JSON) and print the reply");
    send->add_option("request", args.send.request,
                     "The request, e.g. '{\"Command\": 1}'; - for stdin")
        ->required();
    send->add_option("--socket", args.send.socket, "Request socket (default: the daemon's)");
    send->add_option("--timeout", args.timeoutSeconds, "Seconds to wait for the reply (default 30)")
        ->check(CLI::PositiveNumber);

    CLI::App* sign =
        app.add_subcommand("sign", "Write, remove or list code-signing registry entries");
    sign->add_option("executable", args.sign.executable, "The program to sign or unsign");
    sign->add_option("identifier", args.sign.identifier, "Its signing identifier");
    sign->add_option("--entitlements", args.sign.entitlements,
                     "Entitlements as a typed JSON dictionary (default {})");
    sign->add_flag("--remove", args.signRemove, "Remove the executable's entry");
    sign->add_flag("--list", args.signList, "List every entry");

    CLI::App* lock = app.add_subcommand("lock", "Lock the device (key bag lock state)");
    CLI::App* unlock = app.add_subcommand("unlock", "Unlock the device");
    CLI::App* commands = app.add_subcommand("commands", "List the daemon's commands");

    std::vector<CLI::App*> containerCommands;
    containerCommands.push_back(addContainerCommand(app, "create", "Create a container, or find it",
                                                    ContainerAction::Create, args));
    containerCommands.push_back(addContainerCommand(
        app, "lookup", "Find a container, never creating it", ContainerAction::Lookup, args));
    containerCommands.push_back(addContainerCommand(app, "list", "List the containers of a class",
                                                    ContainerAction::List, args));
    CLI::App* info = app.add_subcommand("info", "Read or change a container's info values");
    info->require_subcommand(1);
    CLI::App* infoGet = addContainerCommand(*info, "get", "Print the info value of a key",
                                            ContainerAction::InfoGet, args);
    infoGet->add_option("key", args.container.key, "The info key")->required();
    CLI::App* infoSet = addContainerCommand(*info, "set", "Set the info value of a key",
                                            ContainerAction::InfoSet, args);
    infoSet->add_option("key", args.container.key, "The info key")->required();
    infoSet->add_option("value", args.container.value, "The value as typed JSON, e.g. '\"text\"'")
        ->required();
    CLI::App* infoRemove = addContainerCommand(*info, "remove", "Remove the info value of a key",
                                               ContainerAction::InfoRemove, args);
    infoRemove->add_option("key", args.container.key, "The info key")->required();
    containerCommands.insert(containerCommands.end(), {infoGet, infoSet, infoRemove});
    CLI::App* metadata = addContainerCommand(app, "metadata", "Print a container's metadata",
                                             ContainerAction::Metadata, args);
    metadata->add_flag("--info", args.container.withInfo, "Also print its info dictionary");
    CLI::App* recreate = addContainerCommand(app, "recreate-structure",
                                             "Make a container's missing standard directories",
                                             ContainerAction::RecreateStructure, args);
    recreate
        ->add_option("--command", args.container.recreateCommand,
                     "Send it as command 8 (default) or its twin 22")
        ->check(CLI::IsMember({8, 22}));
    containerCommands.insert(containerCommands.end(), {metadata, recreate});

    try {
        app.parse(argc, argv);
        if (sign->parsed()) validateSign(args);
    } catch (const CLI::ParseError& e) {
        const int status = app.exit(e);
        return status == 0 ? kExitSuccess : kExitUsage;
    }

    if (send->parsed()) {
        args.send.json = args.json;
        args.send.timeout = timeoutOf(args.timeoutSeconds);
        return runSend(args.send, std::cin, std::cout, std::cerr);
    }
    for (CLI::App* command : containerCommands) {
        if (!command->parsed()) continue;
        args.container.json = args.json;
        args.container.user = args.user;
        args.container.socket = args.send.socket;
        args.container.timeout = timeoutOf(args.timeoutSeconds);
        return runContainerCommand(args.container, std::cout, std::cerr);
    }
    if (sign->parsed()) {
        args.sign.json = args.json;
        return runSign(args.sign, std::cout, std::cerr);
    }
    if (lock->parsed() || unlock->parsed())
        return runSetLockState(lock->parsed(), args.json, std::cout, std::cerr);
    if (commands->parsed()) return runListCommands(args.json, std::cout);
    return kExitUsage;
}
