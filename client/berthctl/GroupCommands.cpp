#include "GroupCommands.h"

#include <ostream>

#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "libberth/BerthGroups.h"

namespace berth::ctl {

namespace {

int fail(const ContainerError& failure, std::ostream& err) {
    err << "error: " << failure.describe() << "\n";
    if (failure.isReplyError()) return kExitFailure;
    return failure.transport.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
}

int printPaths(const GroupContainerPaths& paths, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::dictionary();
        for (const auto& [group, path] : paths) result.set(group, path.string());
        out << valueToJson(result) << "\n";
    } else {
        for (const auto& [group, path] : paths) out << group << "  " << path.string() << "\n";
    }
    return kExitSuccess;
}

int printPath(const std::filesystem::path& path, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::dictionary();
        result.set("path", path.string());
        out << valueToJson(result) << "\n";
    } else {
        out << path.string() << "\n";
    }
    return kExitSuccess;
}

}  // namespace

int runGroupCommand(const GroupOptions& options, std::ostream& out, std::ostream& err) {
    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    BerthGroups groups(*connection, options.timeout);
    ContainerError failure;
    switch (options.action) {
        case GroupAction::Groups:
        case GroupAction::SystemGroups: {
            auto paths =
                options.action == GroupAction::Groups
                    ? groups.groupContainerPaths(options.identifier, options.user, &failure)
                    : groups.systemGroupContainerPaths(options.identifier, &failure);
            return paths ? printPaths(*paths, options.json, out) : fail(failure, err);
        }
        case GroupAction::GroupIdentifiers: {
            auto identifiers = groups.groupIdentifiers(options.identifier, options.user, &failure);
            if (!identifiers) return fail(failure, err);
            if (options.json) {
                Value list = Value::array();
                for (const std::string& group : *identifiers) list.push(group);
                out << valueToJson(list) << "\n";
            } else {
                for (const std::string& group : *identifiers) out << group << "\n";
            }
            return kExitSuccess;
        }
        case GroupAction::SystemContainer: {
            auto path = groups.systemContainerPath(options.identifier, &failure);
            return path ? printPath(*path, options.json, out) : fail(failure, err);
        }
        case GroupAction::SystemGroup: {
            auto path =
                groups.systemGroupContainerPath(options.identifier, options.group, &failure);
            return path ? printPath(*path, options.json, out) : fail(failure, err);
        }
    }
    return kExitUsage;
}

}  // namespace berth::ctl
