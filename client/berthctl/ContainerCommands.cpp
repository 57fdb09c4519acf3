#include "ContainerCommands.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <iostream>

#include "ExitStatus.h"
#include "core/BTHContainerClass.h"
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

std::optional<Uuid> parseUuid(std::string_view text, std::string* why) {
    std::optional<Uuid> uuid = Uuid::parse(text);
    if (!uuid) *why = "\"" + std::string(text) + "\" is not a UUID (8-4-4-4-12 hexadecimal digits)";
    return uuid;
}

// One container as the command line gives it; `prefix` is that of its option
// names ("" for --uuid, "new-" for --new-uuid).
struct GivenContainer {
    std::string_view containerClass;
    uint64_t user;
    const std::optional<std::string>& identifier;
    std::string_view uuid;
    std::string_view prefix;
};

// The selector of `given`; nullopt with the reason when its class or UUID
// cannot be read.
std::optional<ContainerSelector> selectorOf(const GivenContainer& given, std::string* why) {
    const std::optional<uint64_t> containerClass = parseContainerClass(given.containerClass, why);
    if (!containerClass) return std::nullopt;
    ContainerSelector selector;
    selector.containerClass = *containerClass;
    selector.userId = given.user;
    selector.identifier = given.identifier;
    if (!given.uuid.empty()) {
        // The daemon finds a container by identifier and UUID together, and
        // gives these commands no default identifier.
        if (!given.identifier) {
            const std::string prefix(given.prefix);
            *why = "--" + prefix + "uuid needs --" + prefix + "identifier too";
            return std::nullopt;
        }
        selector.uuid = parseUuid(given.uuid, why);
        if (!selector.uuid) return std::nullopt;
    }
    return selector;
}

// What the command line asks for, read and checked before anything is sent.
struct Arguments {
    ContainerSelector selector;  // for replace, the new container
    std::optional<ContainerSelector> old;
    std::vector<ContainerSelector> staged;
    std::optional<Value> value;
};

bool readReplace(const ContainerOptions& options, Arguments* arguments, std::string* why) {
    const std::optional<ContainerSelector> replacement = selectorOf(
        {options.containerClass, options.user, options.identifier, options.uuid, "new-"}, why);
    if (!replacement) return false;
    arguments->selector = *replacement;
    if (!options.oldIdentifier) {
        if (options.oldUuid.empty() && options.oldClass.empty() && !options.oldUser) return true;
        *why = "--old-uuid, --old-class and --old-user need --old-identifier";
        return false;
    }
    arguments->old = selectorOf(
        {options.oldClass.empty() ? options.containerClass : options.oldClass,
         options.oldUser.value_or(options.user), options.oldIdentifier, options.oldUuid, "old-"},
        why);
    return arguments->old.has_value();
}

bool readArguments(const ContainerOptions& options, Arguments* arguments, std::string* why) {
    switch (options.action) {
        case ContainerAction::EmptyDeathRow:
            return true;
        case ContainerAction::StageDelete:
            if (options.staged.empty()) {
                *why = "give the containers to stage with --container";
                return false;
            }
            for (const std::string& text : options.staged) {
                std::optional<ContainerSelector> entry = parseContainerEntry(text, why);
                if (!entry) return false;
                arguments->staged.push_back(std::move(*entry));
            }
            return true;
        case ContainerAction::Replace:
            return readReplace(options, arguments, why);
        default:
            break;
    }
    // These two destroy contents: they take no default identifier.
    const bool destroys =
        options.action == ContainerAction::Delete || options.action == ContainerAction::Wipe;
    if (destroys && !options.identifier) {
        *why = "give the container's --identifier";
        return false;
    }
    if (options.action == ContainerAction::Wipe && !options.plugin &&
        options.containerClass.empty()) {
        *why = "give the container's --class, or --plugin for a class 4 container";
        return false;
    }
    if (options.action == ContainerAction::Wipe && options.plugin) {
        if (!options.containerClass.empty()) {
            *why = "--plugin wipes a class 4 container (Data/SprocketPlugin): leave out --class";
            return false;
        }
        arguments->selector.userId = options.user;
        arguments->selector.identifier = options.identifier;
        return true;
    }
    std::optional<ContainerSelector> selector = selectorOf(
        {options.containerClass, options.user, options.identifier, options.uuid, ""}, why);
    if (!selector) return false;
    arguments->selector = std::move(*selector);
    arguments->selector.transient = options.transient;
    if (options.action == ContainerAction::InfoSet) {
        arguments->value = valueFromJson(options.value, why);
        if (!arguments->value) {
            *why = "the value is not valid typed JSON: " + *why;
            return false;
        }
    }
    return true;
}

// Fills in a container's UUID, when it was not given, by a look-up that
// never creates; without an identifier the look-up also gives the caller's
// own. The look-up is always of a permanent container: the daemon answers a
// look-up of a transient one by sending it to death row, so a transient
// container can only be addressed by its UUID.
bool resolve(ContainerSelector& selector, BerthContainers& containers, ContainerError* failure) {
    if (selector.uuid) return true;
    ContainerSelector permanent = selector;
    permanent.transient = false;
    const std::optional<ContainerLocation> location =
        containers.createOrLookup(permanent, false, failure);
    if (!location) return false;
    selector.uuid = location->uuid;
    selector.identifier = location->identifier;
    return true;
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

// "com.example.notes 5E5303C5-…", or a value with both for JSON.
std::string named(const ContainerSelector& selector) {
    return selector.identifier.value_or("") + " " + (selector.uuid ? selector.uuid->string() : "");
}

Value namedJson(const ContainerSelector& selector) {
    Value result = Value::dictionary();
    result.set("identifier", selector.identifier.value_or(""));
    if (selector.uuid) result.set("uuid", selector.uuid->string());
    return result;
}

int printReplaced(const std::optional<ContainerSelector>& old, const ContainerSelector& replacement,
                  bool json, std::ostream& out) {
    if (json) {
        Value result = namedJson(replacement);
        if (old) result.set("replaced", namedJson(*old));
        out << valueToJson(result) << "\n";
    } else if (old) {
        out << "replaced " << named(*old) << " with " << named(replacement) << "\n";
    } else {
        out << "made " << named(replacement) << " permanent\n";
    }
    return kExitSuccess;
}

int printStaged(const std::vector<ContainerSelector>& staged, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::array();
        for (const ContainerSelector& container : staged) {
            Value item = namedJson(container);
            item.set("class", container.containerClass);
            item.set("user", container.userId);
            result.push(std::move(item));
        }
        out << valueToJson(result) << "\n";
        return kExitSuccess;
    }
    for (const ContainerSelector& container : staged)
        out << "staged " << named(container) << " for deletion\n";
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
        case ContainerAction::Regenerate:
            if (!containers.regenerateDirectoryUUID(selector, &failure)) return fail(failure, err);
            return printDone(selector, "gave a new directory name to", std::move(json),
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

std::optional<ContainerSelector> parseContainerEntry(std::string_view text, std::string* why) {
    const auto malformed = [&] {
        *why = "\"" + std::string(text) + "\" is no container: give CLASS:USER:IDENTIFIER[:UUID]";
        return std::nullopt;
    };
    const size_t classEnd = text.find(':');
    const size_t userEnd = classEnd == text.npos ? text.npos : text.find(':', classEnd + 1);
    if (userEnd == text.npos) return malformed();
    std::string_view identifier = text.substr(userEnd + 1);
    std::optional<std::string_view> uuid;
    if (const size_t last = identifier.rfind(':'); last != identifier.npos) {
        uuid = identifier.substr(last + 1);
        identifier = identifier.substr(0, last);
    }
    if (identifier.empty()) return malformed();

    ContainerSelector selector;
    const std::optional<uint64_t> containerClass =
        parseContainerClass(text.substr(0, classEnd), why);
    if (!containerClass) return std::nullopt;
    selector.containerClass = *containerClass;
    const std::string_view user = text.substr(classEnd + 1, userEnd - classEnd - 1);
    uint32_t userId = 0;
    const auto [end, ec] = std::from_chars(user.data(), user.data() + user.size(), userId);
    if (user.empty() || ec != std::errc() || end != user.data() + user.size()) {
        *why = "\"" + std::string(user) + "\" is no user id (0-4294967295)";
        return std::nullopt;
    }
    selector.userId = userId;
    selector.identifier = std::string(identifier);
    if (uuid) {
        selector.uuid = parseUuid(*uuid, why);
        if (!selector.uuid) return std::nullopt;
    }
    return selector;
}

int runContainerCommand(const ContainerOptions& options, std::ostream& out, std::ostream& err) {
    std::string why;
    Arguments arguments;
    if (!readArguments(options, &arguments, &why)) {
        err << "error: " << why << "\n";
        return kExitUsage;
    }
    ContainerSelector& selector = arguments.selector;

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
                selector, options.action == ContainerAction::Create, &failure);
            return location ? printLocation(*location, options.json, out) : fail(failure, err);
        }
        case ContainerAction::List: {
            const std::optional<std::vector<ContainerListEntry>> entries =
                containers.list(selector, &failure);
            return entries ? printListing(*entries, options.json, out) : fail(failure, err);
        }
        case ContainerAction::EmptyDeathRow:
            if (!containers.emptyDeathRow(&failure)) return fail(failure, err);
            out << (options.json ? "{\"emptied\":true}" : "emptied death row") << "\n";
            return kExitSuccess;
        case ContainerAction::Delete:
            if (!containers.deleteContainer(selector, &failure)) return fail(failure, err);
            return printDone(selector, "deleted", Value::dictionary(), options.json, out);
        case ContainerAction::Wipe: {
            const bool wiped = options.plugin ? containers.wipePluginData(selector, &failure)
                                              : containers.wipeData(selector, &failure);
            if (!wiped) return fail(failure, err);
            return printDone(selector, "wiped", Value::dictionary(), options.json, out);
        }
        case ContainerAction::StageDelete:
            // Every container is looked up before anything is staged.
            for (ContainerSelector& container : arguments.staged)
                if (!resolve(container, containers, &failure)) return fail(failure, err);
            if (!containers.stageForDelete(arguments.staged, &failure)) return fail(failure, err);
            return printStaged(arguments.staged, options.json, out);
        case ContainerAction::Replace:
            if (arguments.old && !resolve(*arguments.old, containers, &failure))
                return fail(failure, err);
            if (!resolve(selector, containers, &failure) ||
                !containers.replace(arguments.old, selector, &failure))
                return fail(failure, err);
            return printReplaced(arguments.old, selector, options.json, out);
        default:
            break;
    }
    // The remaining commands address one container by its UUID.
    if (!resolve(selector, containers, &failure)) return fail(failure, err);
    return runOnContainer(options, selector, arguments.value, containers, out, err);
}

}  // namespace berth::ctl
