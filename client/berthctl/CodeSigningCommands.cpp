#include "CodeSigningCommands.h"

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

// The information to send: none (a removal), the dictionary given, or the
// entitlements given wrapped as the information's entitlements. False, with
// the reason, for JSON that is not a dictionary.
bool readInformation(const CodeSigningCommandOptions& options, std::optional<Value>* info,
                     std::string* why) {
    if (options.info.empty()) return true;
    std::optional<Value> parsed = valueFromJson(options.info, why);
    if (!parsed) return false;
    if (!parsed->isDictionary()) {
        *why = "the information must be a JSON dictionary";
        return false;
    }
    if (!options.entitlements) {
        *info = std::move(parsed);
        return true;
    }
    Value wrapped = Value::dictionary();
    wrapped.set("sys.kelp.Berth.Entitlements", std::move(*parsed));
    *info = std::move(wrapped);
    return true;
}

int printDone(const char* what, const std::string& identifier, bool json, std::ostream& out) {
    if (json) {
        Value result = Value::dictionary();
        result.set(what, true);
        if (!identifier.empty()) result.set("identifier", identifier);
        out << valueToJson(result) << "\n";
    } else {
        out << what << (identifier.empty() ? "" : " ") << identifier << "\n";
    }
    return kExitSuccess;
}

}  // namespace

int runCodeSigningCommand(const CodeSigningCommandOptions& options, std::ostream& out,
                          std::ostream& err) {
    std::string why;
    std::optional<Value> info;
    if (options.action == CodeSigningAction::Process && !readInformation(options, &info, &why)) {
        err << "error: " << why << "\n";
        return kExitUsage;
    }
    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    if (!connection) return fail(ContainerError{0, "", error.message, error}, err);
    BerthGroups store(*connection, options.timeout);
    ContainerError failure;
    switch (options.action) {
        case CodeSigningAction::Process: {
            CodeSigningOptions processing;
            processing.dataContainerClass = options.dataContainerClass;
            processing.parentIdentifier = options.parent;
            processing.placeholder = options.placeholder;
            if (!store.processCodeSigningInfo(options.identifier, info, processing, &failure))
                return fail(failure, err);
            return printDone(info ? "processed" : "removed", options.identifier, options.json, out);
        }
        case CodeSigningAction::Get: {
            auto recorded = store.codeSigningInfo(options.identifier, &failure);
            if (!recorded) return fail(failure, err);
            out << valueToJson(*recorded, options.json ? -1 : 2) << "\n";
            return kExitSuccess;
        }
        case CodeSigningAction::Invalidate:
            if (!store.invalidateCodeSigningInfo(&failure)) return fail(failure, err);
            return printDone("invalidated", "", options.json, out);
    }
    return kExitUsage;
}

}  // namespace berth::ctl
