#include "core/Commands.h"

namespace berth {

const std::array<BTHCommandInfo, kBTHCommandCount>& BTHCommands() {
    static constexpr std::array<BTHCommandInfo, kBTHCommandCount> commands{{
        {0, "createOrLookupContainer", kBTHEntitlementNone, 1},
        {1, "listContainers", kBTHEntitlementAllowed, 1},
        {2, "replaceContainer", kBTHEntitlementAllowed, 1},
        {3, "stageContainerForDelete", kBTHEntitlementAllowed, 1},
        {4, "deleteContainersOnDeathRow", kBTHEntitlementAllowed, 0},
        {5, "setInfoValue", kBTHEntitlementAllowed, 1},
        {6, "getInfoValue", kBTHEntitlementAllowed, 1},
        {7, "getContainerMetadata", kBTHEntitlementAllowed, 1},
        {8, "recreateDefaultStructure", kBTHEntitlementAllowed, 1},
        {9, "regenerateDirectoryUUID", kBTHEntitlementAllowed, 1},
        {10, "deleteContainer", kBTHEntitlementAllowed, 1},
        {11, "wipePluginDataContainer", kBTHEntitlementWipeContainer, 1},
        {12, "wipeDataContainer", kBTHEntitlementAllowed, 1},
        {13, "groupContainerPaths", kBTHEntitlementNone, 1},
        {14, "groupContainerIdentifiers", kBTHEntitlementAllowed, 1},
        {15, "systemContainerPath", kBTHEntitlementNone, 1},
        {16, "systemGroupContainerPaths", kBTHEntitlementNone, 1},
        {17, "systemGroupContainerPath", kBTHEntitlementNone, 1},
        {18, "processCodeSigningInfo", kBTHEntitlementAllowed, 1},
        {19, "getCodeSigningInfo", kBTHEntitlementAllowed, 1},
        {20, "invalidateCodeSigningInfo", kBTHEntitlementAllowed, 1},
        {21, "setDataProtection", kBTHEntitlementAllowed, 0},
        {22, "recreateDefaultStructure", kBTHEntitlementAllowed, 1},
        {23, "diskUsage", kBTHEntitlementAllowed, 1},
        {24, "performDataMigration", kBTHEntitlementDataMigration, 1},
        {25, "retryTest", kBTHEntitlementAllowed, 1},
        {26, "stageSharedContent", kBTHEntitlementStageSharedContent, 1},
        {27, "setNetworkExtension", kBTHEntitlementNetworkExtension, 1},
        {28, "userManagedAssetsPath", kBTHEntitlementUserManagedAssets, 1},
        {29, "deleteUserManagedAsset", kBTHEntitlementUserManagedAssets, 1},
    }};
    return commands;
}

}  // namespace berth
