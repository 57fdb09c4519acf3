// The dispatch of one received upcall message: checks the request, runs the
// process-containers routine for a request the kernel sent, and fills the
// reply (a success reply with the reply pack buffer, or an error reply with
// a return code).
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <optional>

#include "core/UpcallWire.h"
#include "platform/UniqueFd.h"
#include "platform/UpcallTransport.h"

namespace berth {

// A received message: its bytes as the kernel interface delivers them (the
// message, then the trailer the receiver appended with the sender's audit
// token) and the out-of-line memory that came with it, when it could be
// mapped.
struct BTHUpcallRequestMessage {
    std::array<uint8_t, kBTHUpcallReceivedSize> bytes{};
    std::optional<OutOfLineMemory> data;
};

// The reply to send: `size` bytes of `bytes` and, for a success reply, the
// reply pack buffer's memory to hand over with it.
struct BTHUpcallReplyMessage {
    std::array<uint8_t, kBTHUpcallSuccessReplySize> bytes{};
    size_t size = 0;
    UniqueFd data;
};

// Whether the message was one of this interface's (and `reply` is to be
// sent). Ids other than 322514900 and 322514901 are not handled and leave
// `reply` untouched; 322514901 gets the error reply -303 and false. The
// request's out-of-line memory is released once the request passed its
// checks.
bool demux_server(BTHUpcallRequestMessage& request, BTHUpcallReplyMessage& reply);

}  // namespace berth
