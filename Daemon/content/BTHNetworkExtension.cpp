#include "BTHNetworkExtension.h"

#include "BTHLog.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"

namespace berth {

bool BTHIsNetworkExtensionCaller(const BTHClientConnection& client) {
    const std::optional<std::string>& caller = client.clientBundleIdentifier();
    if (!caller) return false;
    if (*caller == kBTHNetworkExtensionCaller) return true;
    return *caller == kBTHNetworkExtensionTestCaller && DeviceProperties::isInternalBuild();
}

void setNetworkExtensionForUser(BTHClientConnection& client, uid_t userId,
                                const std::optional<std::string>& identifier,
                                uint64_t containerClass, uint64_t* error) {
    BTH_FUNCTION(
        "-[BTHClientConnection setNetworkExtensionForUser:identifier:containerClass:withError:]");
    const BTHErrorRef failure = BTHRunUnderExceptionRule(bthFunctionName, __LINE__, [&] {
        if (!identifier) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't act on invalid input: ID: %@", identifier);
        }
        if (containerClass != BTHContainerClassDataApplication &&
            containerClass != BTHContainerClassDataVPNPlugin) {
            return BTHMakeError(BTHErrorInvalidArgument, nullptr,
                                "Can't set network extension on container of type: %llu, "
                                "identifier: %@",
                                containerClass, *identifier);
        }
        if (!BTHIsNetworkExtensionCaller(client)) {
            return BTHMakeError(BTHErrorInvalidCommand, nullptr,
                                "Only tunnelsessiond can make this call");
        }
        uint64_t code = BTHErrorSuccess;
        const BTHMetadataRef container = client.createOrLookupContainerForUser(
            userId, identifier, true, containerClass, false, true, &code);
        if (!container) {
            return BTHMakeError(
                static_cast<int32_t>(code), nullptr,
                "Failed to create VPN Plugin container for tunnelsessiond: %llu, ID: %@, class: "
                "%llu",
                code, *identifier, containerClass);
        }
        // A mapping that cannot be recorded is reported like a caller that
        // may not ask: the session daemon has no other answer to act on.
        if (!client._setSandboxContainerMappingForUser(userId, kBTHNetworkExtensionAgent,
                                                       containerClass, container->url())) {
            return BTHMakeError(BTHErrorInvalidCommand, nullptr,
                                "Only tunnelsessiond can make this call");
        }
        return BTHErrorRef();
    });
    if (failure) BTHSetErrorCode(error, failure->code64());
}

}  // namespace berth
