#include "BTHCommandTable.h"

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

// The handler of commands whose operation has not been built into this
// daemon yet: the caller learns the command is not available.
void commandNotAvailable(const BTHRequestRef&, const std::shared_ptr<BTHClientConnection>&,
                         uint64_t* replyError) {
    BTHSetErrorCode(replyError, BTHErrorInvalidCommand);
}

// The handlers built into the daemon, by command number: the one place a new
// command is plugged in.
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

BTHCommandHandler handlerOf(uint64_t command) {
    for (const auto& entry : kHandlers)
        if (entry.command == command) return entry.handler;
    return commandNotAvailable;
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
