#include "BTHCommandTable.h"

#include "BTHContainerCommands.h"
#include "BTHError.h"

namespace berth {

namespace {

// The handler of commands whose operation has not been built into this
// daemon yet: the caller learns the command is not available.
void commandNotAvailable(const BTHRequestRef&, const std::shared_ptr<BTHClientConnection>&,
                         uint64_t* replyError) {
    BTHSetErrorCode(replyError, BTHErrorInvalidCommand);
}

constexpr BTHCommandRow row(uint64_t command, const char* name, const char* entitlement,
                            uint32_t repliesAtOnce = 1,
                            BTHCommandHandler handler = commandNotAvailable) {
    return BTHCommandRow{command, name, handler, entitlement, repliesAtOnce, 0};
}

}  // namespace

const std::array<BTHCommandRow, kBTHCommandCount>& BTHCommandTable() {
    static const std::array<BTHCommandRow, kBTHCommandCount> table{{
        row(0, "createOrLookupContainer", kBTHEntitlementNone, 1, createOrLookupContainer),
        row(1, "listContainers", kBTHEntitlementAllowed, 1, listContainers),
        row(2, "replaceContainer", kBTHEntitlementAllowed, 1, replaceContainer),
        row(3, "stageContainerForDelete", kBTHEntitlementAllowed, 1, stageContainerForDelete),
        row(4, "deleteContainersOnDeathRow", kBTHEntitlementAllowed, 0, deleteContainersOnDeathRow),
        row(5, "setInfoValue", kBTHEntitlementAllowed, 1, setInfoValue),
        row(6, "getInfoValue", kBTHEntitlementAllowed, 1, getInfoValue),
        row(7, "getContainerMetadata", kBTHEntitlementAllowed, 1, getContainerMetadata),
        row(8, "recreateDefaultStructure", kBTHEntitlementAllowed, 1, recreateDefaultStructure),
        row(9, "regenerateDirectoryUUID", kBTHEntitlementAllowed, 1, regenerateDirectoryUUID),
        row(10, "deleteContainer", kBTHEntitlementAllowed, 1, deleteContainer),
        row(11, "wipePluginDataContainer", kBTHEntitlementWipeContainer, 1,
            wipePluginDataContainer),
        row(12, "wipeDataContainer", kBTHEntitlementAllowed, 1, wipeDataContainer),
        row(13, "groupContainerPaths", kBTHEntitlementNone),
        row(14, "groupContainerIdentifiers", kBTHEntitlementAllowed),
        row(15, "systemContainerPath", kBTHEntitlementNone),
        row(16, "systemGroupContainerPaths", kBTHEntitlementNone),
        row(17, "systemGroupContainerPath", kBTHEntitlementNone),
        row(18, "processCodeSigningInfo", kBTHEntitlementAllowed),
        row(19, "getCodeSigningInfo", kBTHEntitlementAllowed),
        row(20, "invalidateCodeSigningInfo", kBTHEntitlementAllowed),
        row(21, "setDataProtection", kBTHEntitlementAllowed, 0),
        row(22, "recreateDefaultStructure", kBTHEntitlementAllowed, 1, recreateDefaultStructure),
        row(23, "diskUsage", kBTHEntitlementAllowed),
        row(24, "performDataMigration", kBTHEntitlementDataMigration),
        row(25, "retryTest", kBTHEntitlementAllowed),
        row(26, "stageSharedContent", kBTHEntitlementStageSharedContent),
        row(27, "setNetworkExtension", kBTHEntitlementNetworkExtension),
        row(28, "userManagedAssetsPath", kBTHEntitlementUserManagedAssets),
        row(29, "deleteUserManagedAsset", kBTHEntitlementUserManagedAssets),
    }};
    return table;
}

void BTHSendAsynchronousReply(const BTHRequestRef& request, uint64_t code) {
    request->reply().set("ReplyError", code);
    request->sendReply();
}

}  // namespace berth
