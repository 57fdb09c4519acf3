// Request intake: checks each request against the command table and the
// caller's entitlements, makes the client object for it, runs the command's
// handler, and sends the reply with its "ReplyError".
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// Processes one request end to end. Every request gets exactly one reply,
// except those of the asynchronous commands (4 and 21), whose completion
// replies when the handler left the reply error at 1.
void BTHProcessRequest(const BTHRequestRef& request);

// The client object for a caller that may use a command needing
// `requiredEntitlement`, or null (logged) when it may not.
std::shared_ptr<BTHClientConnection> checkEntitlementsAndInitClientObject(
    const BTHPeerIdentity& peer, const char* requiredEntitlement);

// Whether a request naming `requestedUser` for `containerClass` may proceed
// for a client running as `clientUserId`; on success the user it acts on goes
// to `effectiveUser`. On failure 38 goes to `error` (and is logged) when an
// error location is given.
bool validateUserId(uint32_t requestedUser, uint64_t containerClass, uint32_t clientUserId,
                    uint32_t* effectiveUser, uint64_t* error);

}  // namespace berth
