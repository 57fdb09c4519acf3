// The handler of the protection-class command: moves a data container's
// user data to another protection class.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// Command 21. Replies exactly once, from the change's completion: at once
// when it is refused or finishes, or after the next unlock when it waits
// for one ("RetryIfLocked"). A user not valid for the class is answered by
// the request processor at once (38).
void setDataProtection(const BTHRequestRef& request,
                       const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);

}  // namespace berth
