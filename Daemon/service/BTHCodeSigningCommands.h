// The handlers of the code-signing store's commands (18 to 20): the
// installer reports an item's code-signing information, reads it back, and
// invalidates what no longer has a bundle container.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// 18: records code-signing information; the store's code is the reply error.
void processCodeSigningInfo(const BTHRequestRef& request,
                            const std::shared_ptr<BTHClientConnection>& client,
                            uint64_t* replyError);
// 19: the identifier's information as "ReplyInfoDictionary", else 21.
void getCodeSigningInfo(const BTHRequestRef& request,
                        const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 20: invalidates the entries of identifiers without bundle container.
void invalidateCodeSigningInfo(const BTHRequestRef& request,
                               const std::shared_ptr<BTHClientConnection>& client,
                               uint64_t* replyError);

}  // namespace berth
