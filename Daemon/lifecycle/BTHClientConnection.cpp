#include "BTHClientConnection.h"

#include "core/Format.h"

namespace berth {

BTHClientConnection::BTHClientConnection(
    std::optional<std::string> bundleId, uid_t clientUserId, bool allowOtherIdLookup,
    std::optional<std::vector<std::string>> entitledWipeIdentifiers)
    : clientBundleIdentifier_(std::move(bundleId)),
      clientUserId_(clientUserId),
      allowOtherIdLookup_(allowOtherIdLookup),
      entitledWipeIdentifiers_(std::move(entitledWipeIdentifiers)) {}

BTHClientConnection::BTHClientConnection(std::optional<std::string> bundleId,
                                         bool allowOtherIdLookup)
    : BTHClientConnection(std::move(bundleId), 0, allowOtherIdLookup, std::nullopt) {}

const std::shared_ptr<BTHClientConnection>& BTHClientConnection::sharedClientConnection() {
    static const std::shared_ptr<BTHClientConnection> shared =
        std::make_shared<BTHClientConnection>(kBTHInternalClientIdentifier, true);
    return shared;
}

std::string BTHClientConnection::description() const {
    return format("<BTHClientConnection %@ uid %u%s>", clientBundleIdentifier_, clientUserId_,
                  allowOtherIdLookup_ ? " allowOtherIdLookup" : "");
}

}  // namespace berth
