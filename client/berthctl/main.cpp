// berthctl: the command-line client of berthd. Sends raw requests to the
// daemon, runs its container commands with typed arguments, and does the
// administrator's local chores (signatures, lock state).
// Each subcommand lives in its own module; this file only reads the command
// line and hands over.
#include <CLI/CLI.hpp>
#include <cmath>
#include <iostream>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "CodeSigningCommands.h"
#include "CommandsListing.h"
#include "Completion.h"
#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "GroupCommands.h"
#include "LockCommand.h"
#include "MaintenanceCommands.h"
#include "SendCommand.h"
#include "SharedContentCommands.h"
#include "SignCommand.h"
#include "UpcallCommand.h"
#include "UsageCommands.h"

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
    UpcallOptions upcall;
    UsageOptions usage;
    GroupOptions group;
    CodeSigningCommandOptions codeSigning;
    SharedContentOptions content;
    MaintenanceOptions maintenance;
};

std::chrono::milliseconds timeoutOf(double seconds) {
    return std::chrono::milliseconds(std::max<long long>(1, std::llround(seconds * 1000)));
}

CLI::Option* addClassOption(CLI::App* command, Arguments& args) {
    return command->add_option("--class", args.container.containerClass,
                               "Container class: 1-13 or a name such as Data/Application");
}

CLI::Option* addIdentifierOption(CLI::App* command, const char* name, const char* description,
                                 std::optional<std::string>& identifier) {
    return command->add_option_function<std::string>(
        name, [&identifier](const std::string& id) { identifier = id; }, description);
}

void addConnectionOptions(CLI::App* command, Arguments& args) {
    command->add_option("--socket", args.send.socket, "Request socket (default: the daemon's)");
    command->add_option("--timeout", args.timeoutSeconds, "Seconds to wait for a reply")
        ->check(CLI::PositiveNumber);
}

// The options the container subcommands share: which container, and how to
// reach the daemon. Delete and wipe take no default identifier and no UUID
// (the daemon finds the container by identifier). The commands that address
// a container by UUID take no --transient: the UUID says which container it
// is, and the look-up that finds a missing one finds permanent ones only.
void addContainerOptions(CLI::App* command, ContainerAction action, Arguments& args) {
    ContainerOptions& container = args.container;
    using Action = ContainerAction;
    const bool destroys = action == Action::Delete || action == Action::Wipe;
    CLI::Option* containerClass = addClassOption(command, args);
    if (action != Action::Wipe) containerClass->required();
    command->add_option("--user", args.user, "User id; 1 (default) is your own user");
    if (destroys)
        addIdentifierOption(command, "--identifier", "Container identifier", container.identifier)
            ->required();
    else if (action != Action::List)
        addIdentifierOption(command, "--identifier", "Container identifier (default: your own)",
                            container.identifier);
    if (action != Action::List && action != Action::Create && action != Action::Lookup && !destroys)
        command->add_option("--uuid", container.uuid,
                            "The container's UUID (default: looked up by identifier)");
    if (action == Action::Wipe)
        command
            ->add_flag("--plugin", container.plugin,
                       "Wipe a class 4 container (Data/SprocketPlugin) the caller is "
                       "entitled to wipe, instead of one of --class")
            ->excludes(containerClass);
    const bool sendsTransient = action == Action::Create || action == Action::Lookup ||
                                action == Action::List || action == Action::Delete;
    if (sendsTransient)
        command->add_flag("--transient", container.transient, "A transient container");
    addConnectionOptions(command, args);
}

// The options of replace: the new container, and the old one it replaces.
void addReplaceOptions(CLI::App* command, Arguments& args) {
    ContainerOptions& container = args.container;
    addClassOption(command, args)->required();
    command->add_option("--user", args.user, "User id; 1 (default) is your own user");
    addIdentifierOption(command, "--new-identifier",
                        "The new container's identifier (default: your own)", container.identifier);
    command->add_option("--new-uuid", container.uuid,
                        "The new container's UUID; required for a transient one (default: the "
                        "permanent container of the identifier)");
    CLI::Option* oldIdentifier = addIdentifierOption(
        command, "--old-identifier",
        "The container to replace (default: none; the new one then becomes permanent)",
        container.oldIdentifier);
    command
        ->add_option("--old-uuid", container.oldUuid,
                     "The old container's UUID (default: looked up by identifier)")
        ->needs(oldIdentifier);
    command
        ->add_option("--old-class", container.oldClass,
                     "The old container's class (default: --class)")
        ->needs(oldIdentifier);
    command
        ->add_option_function<uint32_t>(
            "--old-user", [&container](uint32_t user) { container.oldUser = user; },
            "The old container's user (default: --user)")
        ->needs(oldIdentifier);
    addConnectionOptions(command, args);
}

// Adds a container subcommand that runs `action`.
CLI::App* addContainerCommand(CLI::App& parent, const char* name, const char* description,
                              ContainerAction action, Arguments& args) {
    CLI::App* command = parent.add_subcommand(name, description);
    command->callback([&args, action] { args.container.action = action; });
    switch (action) {
        case ContainerAction::Replace:
            addReplaceOptions(command, args);
            break;
        case ContainerAction::StageDelete:
            command
                ->add_option("--container", args.container.staged,
                             "A container to stage: CLASS:USER:IDENTIFIER[:UUID] (UUID "
                             "default: looked up); repeat for more")
                ->required();
            addConnectionOptions(command, args);
            break;
        case ContainerAction::EmptyDeathRow:
            addConnectionOptions(command, args);
            break;
        default:
            addContainerOptions(command, action, args);
    }
    return command;
}

// "upcall": a process-containers request as the kernel sends it.
CLI::App* addUpcallCommand(CLI::App& app, UpcallOptions& options) {
    berth::upcall::Request& request = options.request;
    CLI::App* command = app.add_subcommand(
        "upcall", "Ask for a starting process's containers as the kernel does (root only)");
    command->add_option("--identifier", request.signingIdentifier, "The signing identifier")
        ->required();
    command->add_option("--container-identifier", request.containerIdentifier,
                        "The data container's identifier, when it differs");
    command->add_option("--persona", request.persona, "The user whose containers are meant")
        ->required();
    command->add_flag("--plugin", request.plugin, "A plug-in (container type 1)");
    command->add_option("--group", request.groups, "An application group; repeat for more");
    command->add_option("--system-container", request.systemContainer,
                        "The system container's identifier");
    command->add_option("--system-group", request.systemGroups, "A system group; repeat for more");
    command->add_option("--socket", options.socket, "Upcall socket (default: the daemon's)");
    return command;
}

// "usage" and "protect": which container, and for protect the class.
CLI::App* addUsageCommand(CLI::App& app, UsageOptions::Action action, Arguments& args) {
    const bool protect = action == UsageOptions::Action::Protect;
    CLI::App* command =
        protect ? app.add_subcommand("protect",
                                     "Move a data container's user data to another "
                                     "protection class")
                : app.add_subcommand("usage", "Print the bytes a container's files occupy");
    UsageOptions& usage = args.usage;
    command->callback([&usage, action] { usage.action = action; });
    command
        ->add_option("--class", usage.containerClass,
                     "Container class: 1-13 or a name such as Data/Application")
        ->required();
    command->add_option("--user", usage.user, "User id; 1 (default) is your own user");
    addIdentifierOption(command, "--identifier", "Container identifier (default: your own)",
                        usage.identifier);
    if (protect) {
        command->add_option("protection-class", usage.protectionClass, "The class to apply")
            ->required();
        command->add_flag("--third-party", usage.thirdParty,
                          "The app is a third party's (only classes 0, 1 and 3 allowed)");
        command->add_flag("--wait", usage.wait,
                          "If the device is locked, wait for the next unlock and the reply");
    } else {
        command->add_option("--uuid", usage.uuid,
                            "The container's UUID (default: looked up by identifier)");
    }
    addConnectionOptions(command, args);
    return command;
}

// Adds a group subcommand that runs `action`.
CLI::App* addGroupCommand(CLI::App& parent, const char* name, const char* description,
                          GroupAction action, Arguments& args) {
    CLI::App* command = parent.add_subcommand(name, description);
    command->callback([&args, action] { args.group.action = action; });
    addIdentifierOption(command, "--identifier", "Identifier (default: your own)",
                        args.group.identifier);
    if (action == GroupAction::Groups || action == GroupAction::GroupIdentifiers)
        command->add_option("--user", args.group.user, "User id; 1 (default) is your own user");
    if (action == GroupAction::SystemGroup)
        command->add_option("group", args.group.group, "The system group identifier")->required();
    addConnectionOptions(command, args);
    return command;
}

// Adds "stage-shared", "net-extension" and "assets" with its two
// subcommands; returns every one that runs an action.
std::vector<CLI::App*> addSharedContentCommands(CLI::App& app, Arguments& args) {
    SharedContentOptions& options = args.content;
    auto actionOf = [&options, &args](CLI::App* command, SharedContentAction action) {
        command->callback([&options, action] { options.action = action; });
        addConnectionOptions(command, args);
        return command;
    };
    CLI::App* stage = actionOf(
        app.add_subcommand("stage-shared",
                           "Move an item to another place inside a system-group container"),
        SharedContentAction::StageShared);
    stage->add_option("group", options.identifier, "The system group identifier")->required();
    stage->add_option("source", options.source, "The item, relative to the container")->required();
    stage->add_option("dest", options.dest, "Its new place, relative to the container")->required();
    CLI::App* net = actionOf(app.add_subcommand("net-extension",
                                                "Make a network plug-in's data container and "
                                                "record it for the network-extension agent"),
                             SharedContentAction::NetExtension);
    net->add_option("identifier", options.identifier, "The plug-in's identifier")->required();
    net->add_option("--class", options.containerClass,
                    "Data/VPNPlugin (6, default) or Data/Application (2)");
    CLI::App* assets = app.add_subcommand(
        "assets", "An app's user-managed assets directory (current mobile user)");
    assets->require_subcommand(1);
    CLI::App* path =
        actionOf(assets->add_subcommand("path", "Print the assets directory, made on first use"),
                 SharedContentAction::AssetsPath);
    path->add_option("identifier", options.identifier, "The app's identifier")->required();
    CLI::App* remove = actionOf(
        assets->add_subcommand("delete", "Move an item of the assets directory to death row"),
        SharedContentAction::AssetsDelete);
    remove->add_option("identifier", options.identifier, "The app's identifier")->required();
    remove->add_option("path", options.source, "The item, relative to the assets directory")
        ->required();
    return {stage, net, path, remove};
}

// Adds "migrate" and "retry-test"; returns both.
std::vector<CLI::App*> addMaintenanceCommands(CLI::App& app, Arguments& args) {
    MaintenanceOptions& options = args.maintenance;
    CLI::App* migrate = app.add_subcommand(
        "migrate",
        "Run the data migration: system-container access lists, bundle ownership, "
        "older code-signing records");
    migrate->callback([&options] { options.action = MaintenanceAction::Migrate; });
    addConnectionOptions(migrate, args);
    CLI::App* retry =
        app.add_subcommand("retry-test",
                           "Have the daemon exit N times in a row, reconnecting until it succeeds "
                           "(internal builds)");
    retry->callback([&options] { options.action = MaintenanceAction::RetryTest; });
    retry->add_option("--crashes", options.crashes, "How many times the daemon exits (default 2)");
    retry->add_option("--user", options.user, "User id; 1 (default) is your own user");
    addConnectionOptions(retry, args);
    return {migrate, retry};
}

// Adds "codesign" with its three subcommands.
CLI::App* addCodeSigningCommands(CLI::App& app, Arguments& args) {
    CLI::App* codesign = app.add_subcommand("codesign", "Record or read code-signing information");
    codesign->require_subcommand(1);
    CodeSigningCommandOptions& options = args.codeSigning;
    CLI::App* process = codesign->add_subcommand(
        "process", "Record an identifier's code-signing information (none: remove it)");
    process->callback([&options] { options.action = CodeSigningAction::Process; });
    process->add_option("identifier", options.identifier, "The identifier")->required();
    process->add_option("--info", options.info, "The information as a typed JSON dictionary");
    process->add_flag("--entitlements", options.entitlements, "--info holds only the entitlements");
    process->add_option_function<uint64_t>(
        "--data-class", [&options](uint64_t c) { options.dataContainerClass = c; },
        "The identifier's data container class");
    process->add_option_function<std::string>(
        "--parent", [&options](const std::string& p) { options.parent = p; },
        "The identifier is a child of this one");
    process->add_flag("--placeholder", options.placeholder, "Placeholder entitlements");
    addConnectionOptions(process, args);
    CLI::App* get =
        codesign->add_subcommand("get", "Print an identifier's code-signing information");
    get->callback([&options] { options.action = CodeSigningAction::Get; });
    get->add_option("identifier", options.identifier, "The identifier")->required();
    addConnectionOptions(get, args);
    CLI::App* invalidate = codesign->add_subcommand(
        "invalidate", "Invalidate the information of identifiers without bundle container");
    invalidate->callback([&options] { options.action = CodeSigningAction::Invalidate; });
    addConnectionOptions(invalidate, args);
    return codesign;
}

// Checks what CLI11 cannot: which positionals the chosen sign action needs.
void validateSign(Arguments& args) {
    if (args.signRemove && args.signList)
        throw CLI::ValidationError("sign", "--remove and --list exclude each other");
    SignOptions& sign = args.sign;
    sign.action = args.signList     ? SignOptions::Action::List
                  : args.signRemove ? SignOptions::Action::Remove
                                    : SignOptions::Action::Sign;
    if (!sign.unit.empty()) {
        // With --unit the one positional is the identifier.
        if (sign.identifier.empty())
            sign.identifier = sign.executable.string();
        else
            throw CLI::ValidationError("sign", "--unit takes no executable");
        sign.executable.clear();
    }
    const bool hasPath = !sign.executable.empty() || !sign.unit.empty();
    const bool hasIdentifier = !sign.identifier.empty();
    switch (sign.action) {
        case SignOptions::Action::List:
            if (hasPath || hasIdentifier)
                throw CLI::ValidationError("sign",
                                           "--list takes no executable, unit or identifier");
            break;
        case SignOptions::Action::Remove:
            if (!hasPath || hasIdentifier)
                throw CLI::ValidationError("sign", "--remove takes the executable or unit alone");
            break;
        case SignOptions::Action::Sign:
            if (!hasPath || !hasIdentifier)
                throw CLI::ValidationError(
                    "sign", "give the executable (or --unit NAME) and its identifier");
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
    sign->add_option("--unit", args.sign.unit,
                     "Bind a service manager unit (NAME.service) instead of an executable");
    sign->add_option("--entitlements", args.sign.entitlements,
                     "Entitlements as a typed JSON dictionary (default {})");
    sign->add_flag("--remove", args.signRemove, "Remove the executable's or unit's entry");
    sign->add_flag("--list", args.signList, "List every entry");

    CLI::App* lock = app.add_subcommand("lock", "Lock the device (key bag lock state)");
    CLI::App* unlock = app.add_subcommand("unlock", "Unlock the device");
    CLI::App* commands = app.add_subcommand("commands", "List the daemon's commands");
    CLI::App* upcall = addUpcallCommand(app, args.upcall);
    CLI::App* usage = addUsageCommand(app, UsageOptions::Action::Usage, args);
    CLI::App* protect = addUsageCommand(app, UsageOptions::Action::Protect, args);

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
    const struct {
        const char* name;
        const char* description;
        ContainerAction action;
    } removals[] = {
        {"replace", "Put one container in the place of another, or make a transient one permanent",
         ContainerAction::Replace},
        {"stage-delete", "Move containers to death row", ContainerAction::StageDelete},
        {"empty-death-row", "Destroy what is on death row; returns when it is done",
         ContainerAction::EmptyDeathRow},
        {"regenerate", "Give a container's directory a new UUID name", ContainerAction::Regenerate},
        {"delete", "Move a container, found by identifier, to death row", ContainerAction::Delete},
        {"wipe", "Give a data container fresh contents, keeping its UUID and path",
         ContainerAction::Wipe},
    };
    for (const auto& removal : removals)
        containerCommands.push_back(
            addContainerCommand(app, removal.name, removal.description, removal.action, args));
    const struct {
        const char* name;
        const char* description;
        GroupAction action;
    } groupActions[] = {
        {"groups", "Print the paths of an identifier's app-group containers (made on demand)",
         GroupAction::Groups},
        {"group-identifiers", "Print an identifier's app-group identifiers",
         GroupAction::GroupIdentifiers},
        {"system-container", "Print the path of an identifier's system container",
         GroupAction::SystemContainer},
        {"system-groups", "Print the paths of an identifier's system-group containers",
         GroupAction::SystemGroups},
        {"system-group", "Print the path of one system-group container", GroupAction::SystemGroup},
    };
    std::vector<CLI::App*> groupCommands;
    for (const auto& action : groupActions)
        groupCommands.push_back(
            addGroupCommand(app, action.name, action.description, action.action, args));
    CLI::App* codesign = addCodeSigningCommands(app, args);
    const std::vector<CLI::App*> contentCommands = addSharedContentCommands(app, args);
    const std::vector<CLI::App*> maintenanceCommands = addMaintenanceCommands(app, args);

    // Asked by the shells' completion scripts; never shown in the help.
    if (argc >= 2 && std::string_view(argv[1]) == "__complete")
        return printCompletions(app, std::vector<std::string>(argv + 2, argv + argc), std::cout);

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
    if (usage->parsed() || protect->parsed()) {
        args.usage.json = args.json;
        args.usage.socket = args.send.socket;
        args.usage.timeout = timeoutOf(args.timeoutSeconds);
        return runUsageCommand(args.usage, std::cout, std::cerr);
    }
    for (CLI::App* command : groupCommands) {
        if (!command->parsed()) continue;
        args.group.json = args.json;
        args.group.socket = args.send.socket;
        args.group.timeout = timeoutOf(args.timeoutSeconds);
        return runGroupCommand(args.group, std::cout, std::cerr);
    }
    for (CLI::App* command : contentCommands) {
        if (!command->parsed()) continue;
        args.content.json = args.json;
        args.content.socket = args.send.socket;
        args.content.timeout = timeoutOf(args.timeoutSeconds);
        return runSharedContentCommand(args.content, std::cout, std::cerr);
    }
    for (CLI::App* command : maintenanceCommands) {
        if (!command->parsed()) continue;
        args.maintenance.json = args.json;
        args.maintenance.socket = args.send.socket;
        // The migration may walk every container: a longer wait than a
        // request's, unless one was asked for.
        if (command->count("--timeout") > 0)
            args.maintenance.timeout = timeoutOf(args.timeoutSeconds);
        return runMaintenanceCommand(args.maintenance, std::cout, std::cerr);
    }
    if (codesign->parsed()) {
        args.codeSigning.json = args.json;
        args.codeSigning.socket = args.send.socket;
        args.codeSigning.timeout = timeoutOf(args.timeoutSeconds);
        return runCodeSigningCommand(args.codeSigning, std::cout, std::cerr);
    }
    if (sign->parsed()) {
        args.sign.json = args.json;
        return runSign(args.sign, std::cout, std::cerr);
    }
    if (lock->parsed() || unlock->parsed())
        return runSetLockState(lock->parsed(), args.json, std::cout, std::cerr);
    if (commands->parsed()) return runListCommands(args.json, std::cout);
    if (upcall->parsed()) {
        args.upcall.json = args.json;
        return runUpcall(args.upcall, std::cout, std::cerr);
    }
    return kExitUsage;
}
