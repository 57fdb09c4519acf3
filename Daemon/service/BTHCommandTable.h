// The daemon's command table: the shared command rows (number, name,
// required entitlement, when the reply goes) each paired with its handler,
// indexed by command number.
#pragma once

#include <array>
#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"
#include "core/Commands.h"

namespace berth {

// Reads its keys from the request, calls one operation, adds its reply keys,
// and writes a failure code through `replyError` (which starts at 1).
using BTHCommandHandler = void (*)(const BTHRequestRef& request,
                                   const std::shared_ptr<BTHClientConnection>& client,
                                   uint64_t* replyError);

struct BTHCommandRow {
    uint64_t command;
    const char* name;
    BTHCommandHandler handler;
    const char* requiredEntitlement;
    uint32_t repliesAtOnce;
    uint32_t spare;
};

const std::array<BTHCommandRow, kBTHCommandCount>& BTHCommandTable();

// Sets "ReplyError" to `code` on the request's reply and sends it: the
// completion of the commands that reply asynchronously.
void BTHSendAsynchronousReply(const BTHRequestRef& request, uint64_t code);

}  // namespace berth
