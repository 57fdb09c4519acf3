#include "UpcallCommand.h"

#include <cstring>
#include <iostream>

#include "ExitStatus.h"
#include "core/Value.h"
#include "core/ValueJson.h"

namespace berth::ctl {

namespace {

Value pairsValue(const std::vector<std::pair<std::string, std::string>>& pairs) {
    Value result = Value::dictionary();
    for (const auto& [identifier, path] : pairs) result.set(identifier, path);
    return result;
}

Value replyValue(const upcall::Reply& reply) {
    Value result = Value::dictionary();
    const std::pair<const char*, const std::optional<std::string>*> singles[] = {
        {"home", &reply.home},
        {"dataContainer", &reply.dataContainer},
        {"tmp", &reply.tmp},
        {"systemContainer", &reply.systemContainer},
    };
    for (const auto& [key, value] : singles)
        if (*value) result.set(key, **value);
    if (!reply.groups.empty()) result.set("groups", pairsValue(reply.groups));
    if (!reply.systemGroups.empty()) result.set("systemGroups", pairsValue(reply.systemGroups));
    result.set("success", reply.success);
    return result;
}

void printPlain(const upcall::Reply& reply, std::ostream& out) {
    if (reply.home) out << "home: " << *reply.home << "\n";
    if (reply.dataContainer) out << "data container: " << *reply.dataContainer << "\n";
    if (reply.tmp) out << "tmp: " << *reply.tmp << "\n";
    for (const auto& [identifier, path] : reply.groups)
        out << "group " << identifier << ": " << path << "\n";
    if (reply.systemContainer) out << "system container: " << *reply.systemContainer << "\n";
    for (const auto& [identifier, path] : reply.systemGroups)
        out << "system group " << identifier << ": " << path << "\n";
    out << "success: " << (reply.success ? 1 : 0) << "\n";
}

}  // namespace

int runUpcall(const UpcallOptions& options, std::ostream& out, std::ostream& err) {
    upcall::CallFailure failure;
    const std::optional<upcall::Answer> answer =
        upcall::call(options.request, options.socket, &failure);
    if (!answer) {
        switch (failure.stage) {
            case upcall::CallFailure::Stage::Connect:
                err << "error: cannot reach the daemon's upcall socket: "
                    << std::strerror(failure.error) << "\n";
                break;
            case upcall::CallFailure::Stage::Exchange:
                err << "error: the upcall exchange failed: " << std::strerror(failure.error)
                    << "\n";
                break;
            case upcall::CallFailure::Stage::Decode:
                err << "error: unreadable answer: " << failure.detail << "\n";
                break;
        }
        return kExitTransport;
    }
    if (answer->returnCode != 0) {
        if (options.json) {
            Value result = Value::dictionary();
            result.set("returnCode", int64_t{answer->returnCode});
            out << valueToJson(result) << "\n";
        }
        err << "error: the daemon answered return code " << answer->returnCode << ": "
            << upcall::returnCodeText(answer->returnCode) << "\n";
        return kExitFailure;
    }
    if (options.json)
        out << valueToJson(replyValue(answer->reply)) << "\n";
    else
        printPlain(answer->reply, out);
    if (answer->reply.success) return kExitSuccess;
    err << "error: the daemon could not provide every container (success 0)\n";
    return kExitFailure;
}

}  // namespace berth::ctl
