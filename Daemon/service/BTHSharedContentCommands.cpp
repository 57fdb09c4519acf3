#include "BTHSharedContentCommands.h"

#include "BTHGlobalConfiguration.h"
#include "BTHNetworkExtension.h"
#include "BTHRequestReaders.h"
#include "BTHSharedContent.h"
#include "BTHUserManagedAssets.h"

namespace berth {

namespace {

uid_t mobileUser() {
    return BTHGlobalConfiguration::sharedInstance().currentMobileUserId();
}

}  // namespace

void stageSharedContent(const BTHRequestRef& request,
                        const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    const auto staged = stageSharedContentForIdentifier(
        *client, BTHRequestString(message, "Identifier"), BTHRequestString(message, "SourcePath"),
        BTHRequestString(message, "DestPath"), replyError);
    if (staged) request->reply().set("ReplyPath", staged->string());
}

void setNetworkExtension(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError) {
    const Value& message = request->message();
    setNetworkExtensionForUser(*client, mobileUser(), BTHRequestString(message, "Identifier"),
                               BTHRequestUInt64(message, "ContainerClass"), replyError);
}

void userManagedAssetsPath(const BTHRequestRef& request,
                           const std::shared_ptr<BTHClientConnection>&, uint64_t* replyError) {
    const auto assets = userManagedAssetsURLForUser(
        mobileUser(), BTHRequestString(request->message(), "Identifier"), replyError);
    if (assets) request->reply().set("ReplyPath", assets->string());
}

void deleteUserManagedAsset(const BTHRequestRef& request,
                            const std::shared_ptr<BTHClientConnection>& client,
                            uint64_t* replyError) {
    const Value& message = request->message();
    deleteUserManagedAssetForUser(*client, mobileUser(), BTHRequestString(message, "Identifier"),
                                  BTHRequestString(message, "SourcePath"), replyError);
}

}  // namespace berth
