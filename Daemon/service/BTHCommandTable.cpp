#include "BTHCommandTable.h"

#include <iterator>

#include "BTHCodeSigningCommands.h"
#include "BTHContainerCommands.h"
#include "BTHError.h"
#include "BTHGroupCommands.h"
#include "BTHMaintenanceCommands.h"
#include "BTHProtectionCommands.h"
#include "BTHSharedContentCommands.h"
#include "BTHUsageCommands.h"

namespace berth {

namespace {

// The handlers of the daemon, by command number: the one place a command is
// plugged in. Every command has one, in order (checked below).
constexpr struct {
    uint64_t command;
    BTHCommandHandler handler;
} kHandlers[] = {
    {0, createOrLookupContainer},
    {1, listContainers},
    {2, replaceContainer},
    {3, stageContainerForDelete},
    {4, deleteContainersOnDeathRow},
    {5, setInfoValue},
    {6, getInfoValue},
    {7, getContainerMetadata},
    {8, recreateDefaultStructure},
    {9, regenerateDirectoryUUID},
    {10, deleteContainer},
    {11, wipePluginDataContainer},
    {12, wipeDataContainer},
    {13, groupContainerPaths},
    {14, groupContainerIdentifiers},
    {15, systemContainerPath},
    {16, systemGroupContainerPaths},
    {17, systemGroupContainerPath},
    {18, processCodeSigningInfo},
    {19, getCodeSigningInfo},
    {20, invalidateCodeSigningInfo},
    {21, setDataProtection},
    {22, recreateDefaultStructure},
    {23, diskUsage},
    {24, performDataMigration},
    {25, retryTest},
    {26, stageSharedContent},
    {27, setNetworkExtension},
    {28, userManagedAssetsPath},
    {29, deleteUserManagedAsset},
};

constexpr bool everyCommandInOrder() {
    if (std::size(kHandlers) != kBTHCommandCount) return false;
    for (uint64_t i = 0; i < std::size(kHandlers); ++i)
        if (kHandlers[i].command != i || !kHandlers[i].handler) return false;
    return true;
}
static_assert(everyCommandInOrder(), "every command needs its handler, in command order");

BTHCommandHandler handlerOf(uint64_t command) {
    return kHandlers[command].handler;
}

}  // namespace

const std::array<BTHCommandRow, kBTHCommandCount>& BTHCommandTable() {
    static const std::array<BTHCommandRow, kBTHCommandCount> table = [] {
        std::array<BTHCommandRow, kBTHCommandCount> rows{};
        for (const BTHCommandInfo& info : BTHCommands())
            rows[info.command] = BTHCommandRow{
                info.command,       info.name, handlerOf(info.command), info.requiredEntitlement,
                info.repliesAtOnce, 0};
        return rows;
    }();
    return table;
}

void BTHSendAsynchronousReply(const BTHRequestRef& request, uint64_t code) {
    request->reply().set("ReplyError", code);
    request->sendReply();
}

}  // namespace berth
