#include "ContainerCommands.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <iostream>

#include "BTHContainerClass.h"
#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "libberth/BerthContainers.h"

namespace berth::ctl {

namespace {

bool equalIgnoringCase(std::string_view a, std::string_view b) {
    return std::equal(a.begin(), a.end(), b.begin(), b.end(), [](char x, char y) {
        return std::tolower(static_cast<unsigned char>(x)) ==
               std::tolower(static_cast<unsigned char>(y));
    });
}

// The selector the options describe; nullopt with the reason when the
// class or UUID cannot be read.
std::optional<ContainerSelector> selectorFor(const ContainerOptions& options, std::string* why) {
    const std::optional<uint64_t> containerClass = parseContainerClass(options.containerClass, why);
    if (!containerClass) return std::nullopt;
    ContainerSelector selector;
    selector.containerClass = *containerClass;
    selector.userId = options.user;
    selector.identifier = options.identifier;
    selector.transient = options.transient;
    if (!options.uuid.empty()) {
        // The daemon finds a container by identifier and UUID together, and
        // gives these commands no default identifier.
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

// Reports a failed call; returns the exit status.
int fail(const ContainerError& failure, std::ostream& err) {
    err << "error: " << failure.describe() << "\n";
    if (failure.isReplyError()) return kExitFailure;
    return failure.transport.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
}

void printField(std::ostream& out, std::string_view label, std::string_view text) {
    out << "    " << label << std::string(12 - std::min<size_t>(label.size(), 11), ' ') << text
        << "\n";
}

int printLocation(const ContainerLocation& location, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::dictionary();
        result.set("path", location.path.string());
        result.set("uuid", location.uuid.string());
        result.set("existed", location.existed);
        result.set("identifier", location.identifier);
        out << valueToJson(result) << "\n";
        return kExitSuccess;
    }
    out << (location.existed ? "found " : "created ") << location.identifier << "\n";
    printField(out, "path", location.path.string());
    printField(out, "uuid", location.uuid.string());
    return kExitSuccess;
}

int printListing(const std::vector<ContainerListEntry>& entries, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::array();
        for (const ContainerListEntry& entry : entries) {
            Value item = Value::dictionary();
            item.set("identifier", entry.identifier);
            item.set("uuid", entry.uuid.string());
            result.push(std::move(item));
        }
        out << valueToJson(result) << "\n";
        return kExitSuccess;
    }
    if (entries.empty()) out << "no containers\n";
    for (const ContainerListEntry& entry : entries)
        out << entry.uuid.string() << "  " << entry.identifier << "\n";
    return kExitSuccess;
}

int printMetadata(const ContainerMetadata& metadata, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::dictionary();
        result.set("path", metadata.path.string());
        result.set("transient", metadata.transient);
        if (metadata.info) result.set("info", *metadata.info);
        out << valueToJson(result) << "\n";
        return kExitSuccess;
    }
    out << metadata.path.string() << "\n";
    printField(out, "transient", metadata.transient ? "yes" : "no");
    if (metadata.info) printField(out, "info", valueToJson(*metadata.info));
    return kExitSuccess;
}

// Prints the outcome of a call that answers nothing but its code.
int printDone(const ContainerSelector& selector, std::string_view human, Value json, bool asJson,
              std::ostream& out) {
    if (asJson) {
        json.set("identifier", selector.identifier.value_or(""));
        if (selector.uuid) json.set("uuid", selector.uuid->string());
        out << valueToJson(json) << "\n";
    } else {
        out << human << " " << selector.identifier.value_or("") << "\n";
    }
    return kExitSuccess;
}

int runOnContainer(const ContainerOptions& options, const ContainerSelector& selector,
                   const std::optional<Value>& value, BerthContainers& containers,
                   std::ostream& out, std::ostream& err) {
    ContainerError failure;
    Value json = Value::dictionary();
    switch (options.action) {
        case ContainerAction::InfoGet: {
            const std::optional<Value> found =
                containers.infoValue(selector, options.key, &failure);
            if (!found) return fail(failure, err);
            out << valueToJson(*found, options.json ? -1 : 2) << "\n";
            return kExitSuccess;
        }
        case ContainerAction::InfoSet:
        case ContainerAction::InfoRemove: {
            if (!containers.setInfoValue(selector, options.key, value, &failure))
                return fail(failure, err);
            json.set("key", options.key);
            if (value) json.set("value", *value);
            const std::string human =
                (value ? "set \"" : "removed \"") + options.key + (value ? "\" of" : "\" from");
            return printDone(selector, human, std::move(json), options.json, out);
        }
        case ContainerAction::Metadata: {
            const std::optional<ContainerMetadata> metadata =
                containers.metadata(selector, options.withInfo, &failure);
            return metadata ? printMetadata(*metadata, options.json, out) : fail(failure, err);
        }
        case ContainerAction::RecreateStructure:
            if (!containers.recreateDefaultStructure(selector, &failure, options.recreateCommand))
                return fail(failure, err);
            return printDone(selector, "recreated the default structure of", std::move(json),
                             options.json, out);
        default:
            return kExitUsage;
    }
}

}  // namespace

std::optional<uint64_t> parseContainerClass(std::string_view text, std::string* why) {
    uint64_t number = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), number);
    if (ec == std::errc() && end == text.data() + text.size() && BTHContainerClassIsValid(number))
        return number;
    for (uint64_t candidate = 1; BTHContainerClassIsValid(candidate); ++candidate)
        if (equalIgnoringCase(text, BTHContainerClassName(candidate))) return candidate;
    if (why)
        *why = "\"" + std::string(text) +
               "\" is no container class: give 1-13 or a name such as Data/Application";
    return std::nullopt;
}

int runContainerCommand(const ContainerOptions& options, std::ostream& out, std::ostream& err) {
    std::string why;
    std::optional<ContainerSelector> selector = selectorFor(options, &why);
    std::optional<Value> value;
    if (selector && options.action == ContainerAction::InfoSet) {
        value = valueFromJson(options.value, &why);
        if (!value) why = "the value is not valid typed JSON: " + why;
    }
    if (!selector || (options.action == ContainerAction::InfoSet && !value)) {
        err << "error: " << why << "\n";
        return kExitUsage;
    }

    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    BerthContainers containers(*connection, options.timeout);
    ContainerError failure;

    switch (options.action) {
        case ContainerAction::Create:
        case ContainerAction::Lookup: {
            const std::optional<ContainerLocation> location = containers.createOrLookup(
                *selector, options.action == ContainerAction::Create, &failure);
            return location ? printLocation(*location, options.json, out) : fail(failure, err);
        }
        case ContainerAction::List: {
            const std::optional<std::vector<ContainerListEntry>> entries =
                containers.list(*selector, &failure);
            return entries ? printListing(*entries, options.json, out) : fail(failure, err);
        }
        default:
            break;
    }
    // The remaining commands address one container by its UUID: learn it
    // from a look-up that never creates, which also fills in the caller's
    // own identifier when none was given.
    if (!selector->uuid) {
        const std::optional<ContainerLocation> location =
            containers.createOrLookup(*selector, false, &failure);
        if (!location) return fail(failure, err);
        selector->uuid = location->uuid;
        selector->identifier = location->identifier;
    }
    return runOnContainer(options, *selector, value, containers, out, err);
}

}  // namespace berth::ctl
