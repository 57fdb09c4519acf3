// berthctl: the command-line client of berthd. Sends raw requests to the
// daemon and does the administrator's local chores (signatures, lock state).
// Each subcommand lives in its own module; this file only reads the command
// line and hands over.
#include <CLI/CLI.hpp>
#include <cmath>
#include <iostream>

#include "CommandsListing.h"
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
};

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

    try {
        app.parse(argc, argv);
        if (sign->parsed()) validateSign(args);
    } catch (const CLI::ParseError& e) {
        const int status = app.exit(e);
        return status == 0 ? kExitSuccess : kExitUsage;
    }

    if (send->parsed()) {
        args.send.json = args.json;
        args.send.timeout = std::chrono::milliseconds(
            std::max<long long>(1, std::llround(args.timeoutSeconds * 1000)));
        return runSend(args.send, std::cin, std::cout, std::cerr);
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
