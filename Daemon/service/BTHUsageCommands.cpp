#include "BTHUsageCommands.h"

#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"

namespace berth {

void diskUsage(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
               uint64_t* replyError) {
    const Value& message = request->message();
    const uint64_t containerClass = BTHRequestUInt64(message, "ContainerClass");
    const auto requestedUser = static_cast<uint32_t>(BTHRequestUInt64(message, "UserID"));
    uint32_t userId = 0;
    if (!validateUserId(requestedUser, containerClass, client->clientUserId(), &userId, replyError))
        return;
    const uint64_t usage = client->diskUsageForUserId(userId, BTHRequestUUID(message, "UUID"),
                                                      BTHRequestString(message, "Identifier"),
                                                      containerClass, replyError);
    request->reply().set("ReplyDiskUsage", Value(usage));
}

}  // namespace berth
