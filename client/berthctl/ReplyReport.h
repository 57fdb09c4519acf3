// What berthctl makes of a request it is given and of the reply it gets:
// the pure part of "berthctl send", kept apart from the terminal and the
// socket so it can be checked on its own.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "core/Value.h"

namespace berth::ctl {

// The request written on the command line as typed JSON (see ValueJson.h).
// A request must be a dictionary; anything else gives nullopt with the
// reason in `why`. "Command" is left to the daemon, which reads a missing
// one as command 0.
std::optional<Value> parseRequest(std::string_view text, std::string* why);

// The line that reports a failing "ReplyError": "error: <name> (<number>)"
// for a code of the table, "error: code <number>" for any other number.
std::string errorLine(uint64_t code);

// The outcome of a reply: the exit status, and the line for standard error
// when it is not a success. A reply without an unsigned "ReplyError" is not
// a reply of this daemon: exit kExitTransport.
struct ReplyVerdict {
    int exitStatus;
    std::string errorLine;  // empty on success
};
ReplyVerdict judgeReply(const Value& reply);

}  // namespace berth::ctl
