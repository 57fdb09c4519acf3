#include "BTHProtectionCommands.h"

#include "BTHCommandTable.h"
#include "BTHDataProtectionManager.h"
#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"

namespace berth {

void setDataProtection(const BTHRequestRef& request,
                       const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    const uint64_t containerClass = BTHRequestUInt64(message, "ContainerClass");
    const auto requestedUser = static_cast<uint32_t>(BTHRequestUInt64(message, "UserID"));
    uint32_t userId = 0;
    if (!validateUserId(requestedUser, containerClass, client->clientUserId(), &userId, replyError))
        return;
    // The class travels as a signed number; only its low 32 bits are a class.
    const auto protectionClass = static_cast<int32_t>(
        static_cast<int64_t>(BTHRequestUInt64(message, "DataProtectionClass")));
    BTHDataProtectionManager::defaultManager().setDataProtectionOnDataContainerForUser(
        userId, BTHRequestString(message, "Identifier"), containerClass, protectionClass,
        BTHRequestBool(message, "IsThirdParty"), BTHRequestBool(message, "RetryIfLocked"),
        [request, client](uint64_t code) { BTHSendAsynchronousReply(request, code); });
}

}  // namespace berth
