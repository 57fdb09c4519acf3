#include "UsageCommands.h"

#include <iostream>

#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "libberth/BerthUsage.h"

namespace berth::ctl {

namespace {

int fail(const ContainerError& failure, std::ostream& err) {
    err << "error: " << failure.describe() << "\n";
    if (failure.isReplyError()) return kExitFailure;
    return failure.transport.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
}

// The container the options name; nullopt with the reason for bad options.
std::optional<ContainerSelector> selectorOf(const UsageOptions& options, std::string* why) {
    const std::optional<uint64_t> containerClass = parseContainerClass(options.containerClass, why);
    if (!containerClass) return std::nullopt;
    ContainerSelector selector;
    selector.containerClass = *containerClass;
    selector.userId = options.user;
    selector.identifier = options.identifier;
    if (!options.uuid.empty()) {
        if (!options.identifier) {
            *why = "--uuid needs --identifier too";
            return std::nullopt;
        }
        selector.uuid = Uuid::parse(options.uuid);
        if (!selector.uuid) {
            *why = "\"" + options.uuid + "\" is not a UUID (8-4-4-4-12 hexadecimal digits)";
            return std::nullopt;
        }
    }
    return selector;
}

int runUsage(ContainerSelector selector, BerthConnection& connection, const UsageOptions& options,
             std::ostream& out, std::ostream& err) {
    ContainerError failure;
    if (!selector.uuid) {
        BerthContainers containers(connection, options.timeout);
        const std::optional<ContainerLocation> found =
            containers.createOrLookup(selector, false, &failure);
        if (!found) return fail(failure, err);
        selector.uuid = found->uuid;
        selector.identifier = found->identifier;
    }
    BerthUsage usage(connection, options.timeout);
    const std::optional<uint64_t> bytes = usage.diskUsage(selector, &failure);
    if (!bytes) return fail(failure, err);
    if (options.json) {
        Value result = Value::dictionary();
        result.set("identifier", *selector.identifier);
        result.set("uuid", selector.uuid->string());
        result.set("bytes", *bytes);
        out << valueToJson(result) << "\n";
    } else
        out << *selector.identifier << "  " << *bytes << " bytes\n";
    return kExitSuccess;
}

int runProtect(const ContainerSelector& selector, BerthConnection& connection,
               const UsageOptions& options, std::ostream& out, std::ostream& err) {
    BerthUsage usage(connection, options.wait ? kBerthWaitForever : options.timeout);
    ContainerError failure;
    if (!usage.setDataProtection(selector, options.protectionClass, options.thirdParty,
                                 options.wait, &failure))
        return fail(failure, err);
    if (options.json)
        out << "{\"protectionClass\":" << options.protectionClass << "}\n";
    else
        out << "protection class " << options.protectionClass << " set\n";
    return kExitSuccess;
}

}  // namespace

int runUsageCommand(const UsageOptions& options, std::ostream& out, std::ostream& err) {
    std::string why;
    const std::optional<ContainerSelector> selector = selectorOf(options, &why);
    if (!selector) {
        err << "error: " << why << "\n";
        return kExitUsage;
    }
    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    return options.action == UsageOptions::Action::Usage
               ? runUsage(*selector, *connection, options, out, err)
               : runProtect(*selector, *connection, options, out, err);
}

}  // namespace berth::ctl
