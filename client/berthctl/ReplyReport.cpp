#include "ReplyReport.h"

#include "ExitStatus.h"
#include "core/ErrorCodes.h"
#include "core/ValueJson.h"

namespace berth::ctl {

std::optional<Value> parseRequest(std::string_view text, std::string* why) {
    std::string reason;
    std::optional<Value> request = valueFromJson(text, &reason);
    if (!request) {
        if (why) *why = "the request is not valid JSON: " + reason;
        return std::nullopt;
    }
    if (!request->isDictionary()) {
        if (why)
            *why = std::string("the request must be a JSON object (a dictionary), not ") +
                   kindName(request->kind());
        return std::nullopt;
    }
    return request;
}

std::string errorLine(uint64_t code) {
    const std::string_view name = BTHErrorCodeName(code);
    if (name.empty()) return "error: code " + std::to_string(code);
    return "error: " + std::string(name) + " (" + std::to_string(code) + ")";
}

ReplyVerdict judgeReply(const Value& reply) {
    const Value* code = reply.isDictionary() ? reply.find("ReplyError") : nullptr;
    // The daemon sends the code as an unsigned integer; a negative one is
    // not a code of this daemon, whatever its bits.
    const bool usable = code && (code->kind() == Value::Kind::UInt64 ||
                                 (code->kind() == Value::Kind::Int64 && *code->int64Value() >= 0));
    if (!usable) return {kExitTransport, "error: the reply carries no \"ReplyError\" code"};
    const uint64_t value = *code->uint64Value();
    if (value == BTHErrorSuccess) return {kExitSuccess, ""};
    return {kExitFailure, errorLine(value)};
}

}  // namespace berth::ctl
