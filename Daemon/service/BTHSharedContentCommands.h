// The handlers of the commands where a client names a path or a container
// inside someone else's care: staging shared content (26), network
// extensions (27) and user-managed assets (28, 29). They read keys and fill
// reply keys; the content layer does the work. Commands 27 to 29 take no
// "UserID": they always act for the current mobile user.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// 26: "Identifier" (the system group), "SourcePath", "DestPath", no
// defaults; "ReplyPath" is the staged item's new path.
void stageSharedContent(const BTHRequestRef& request,
                        const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 27: "ContainerClass", "Identifier" (no default).
void setNetworkExtension(const BTHRequestRef& request,
                         const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 28: "Identifier" (no default); "ReplyPath" is the assets directory.
void userManagedAssetsPath(const BTHRequestRef& request,
                           const std::shared_ptr<BTHClientConnection>& client,
                           uint64_t* replyError);
// 29: "Identifier" (no default), "SourcePath" (the asset, relative to the
// assets directory).
void deleteUserManagedAsset(const BTHRequestRef& request,
                            const std::shared_ptr<BTHClientConnection>& client,
                            uint64_t* replyError);

}  // namespace berth
