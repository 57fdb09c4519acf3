// One client request as the request processor sees it: the message, the reply
// being built for it, and who sent it. The message service supplies the
// concrete kind; tests supply their own.
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"

namespace berth {

// Who sent a request, as the message service and the code-signing service
// tell it at the moment the request is processed.
struct BTHPeerIdentity {
    pid_t pid = 0;
    uid_t effectiveUserId = 0;
    // False when the connecting process has exited or now runs another
    // executable than when it connected: nothing it sends is believed.
    bool processStillBound = true;
    // The code-signing identifier; none when the code-signing service could
    // not tell (signingError says why).
    std::optional<std::string> signingIdentifier;
    std::string signingError;
    // The whole entitlement dictionary; none when the caller has none.
    std::optional<Value> entitlements;
};

class BTHRequest {
  public:
    virtual ~BTHRequest() = default;

    // The request dictionary.
    virtual const Value& message() const = 0;
    // The reply made from the request; handlers add their keys to it.
    virtual Value& reply() = 0;
    virtual const BTHPeerIdentity& peer() const = 0;
    // Sends reply() to the waiting caller. Only the first call sends.
    virtual void sendReply() = 0;
};

using BTHRequestRef = std::shared_ptr<BTHRequest>;

}  // namespace berth
