// The bridge between the message service and the request intake: each event
// of a peer connection becomes one processed request.
#pragma once

#include "platform/RelayConnection.h"

namespace berth {

// The request processor of a peer connection: ignores the end of the
// connection, cancels a peer whose message awaits no reply ("Dictionary does
// not have reply context"), and hands every request to the intake.
void BTHProcessRelayEvent(const RelayEvent& event);

}  // namespace berth
