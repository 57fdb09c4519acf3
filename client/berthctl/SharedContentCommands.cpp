#include "SharedContentCommands.h"

#include <ostream>

#include "ContainerCommands.h"
#include "ExitStatus.h"
#include "core/ValueJson.h"
#include "libberth/BerthSharedContent.h"

namespace berth::ctl {

namespace {

int fail(const ContainerError& failure, std::ostream& err) {
    err << "error: " << failure.describe() << "\n";
    if (failure.isReplyError()) return kExitFailure;
    return failure.transport.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
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

int printDone(const std::string& text, bool json, std::ostream& out) {
    out << (json ? "{}" : text) << "\n";
    return kExitSuccess;
}

int run(const SharedContentOptions& options, uint64_t containerClass, BerthConnection& connection,
        std::ostream& out, std::ostream& err) {
    BerthSharedContent content(connection, options.timeout);
    ContainerError failure;
    switch (options.action) {
        case SharedContentAction::StageShared: {
            auto staged = content.stageSharedContent(options.identifier, options.source,
                                                     options.dest, &failure);
            return staged ? printPath(*staged, options.json, out) : fail(failure, err);
        }
        case SharedContentAction::NetExtension:
            return content.setNetworkExtension(options.identifier, containerClass, &failure)
                       ? printDone("container set for the network-extension agent", options.json,
                                   out)
                       : fail(failure, err);
        case SharedContentAction::AssetsPath: {
            auto assets = content.userManagedAssetsPath(options.identifier, &failure);
            return assets ? printPath(*assets, options.json, out) : fail(failure, err);
        }
        case SharedContentAction::AssetsDelete:
            return content.deleteUserManagedAsset(options.identifier, options.source, &failure)
                       ? printDone("moved to death row", options.json, out)
                       : fail(failure, err);
    }
    return kExitUsage;
}

}  // namespace

int runSharedContentCommand(const SharedContentOptions& options, std::ostream& out,
                            std::ostream& err) {
    uint64_t containerClass = 0;
    if (options.action == SharedContentAction::NetExtension) {
        std::string why;
        const std::optional<uint64_t> parsed = parseContainerClass(options.containerClass, &why);
        if (!parsed) {
            err << "error: " << why << "\n";
            return kExitUsage;
        }
        containerClass = *parsed;
    }
    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    return run(options, containerClass, *connection, out, err);
}

}  // namespace berth::ctl
