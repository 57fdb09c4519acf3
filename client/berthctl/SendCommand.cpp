#include "SendCommand.h"

#include <iostream>
#include <iterator>

#include "ExitStatus.h"
#include "ReplyReport.h"
#include "core/ValueJson.h"
#include "libberth/BerthConnection.h"

namespace berth::ctl {

namespace {

std::string requestText(const SendOptions& options, std::istream& in) {
    if (options.request != "-") return options.request;
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

}  // namespace

int runSend(const SendOptions& options, std::istream& in, std::ostream& out, std::ostream& err) {
    std::string why;
    const std::optional<Value> request = parseRequest(requestText(options, in), &why);
    if (!request) {
        err << "error: " << why << "\n";
        return kExitUsage;
    }

    BerthError error;
    const std::unique_ptr<BerthConnection> connection =
        options.socket.empty() ? BerthConnection::connect(&error)
                               : BerthConnection::connect(options.socket, &error);
    std::optional<Value> reply;
    if (connection) reply = connection->request(*request, options.timeout, &error);
    if (!reply) {
        err << "error: " << error.message << "\n";
        return error.code == BerthError::Code::InvalidRequest ? kExitUsage : kExitTransport;
    }

    out << valueToJson(*reply, options.json ? -1 : 2) << "\n";
    const ReplyVerdict verdict = judgeReply(*reply);
    if (!verdict.errorLine.empty()) err << verdict.errorLine << "\n";
    return verdict.exitStatus;
}

}  // namespace berth::ctl
