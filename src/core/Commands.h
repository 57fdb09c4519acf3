// The 30 commands of the request socket as the daemon and its clients both
// know them: number, name, the entitlement a caller needs, and whether the
// reply is sent when the command's handler returns or later, from its
// completion. The daemon pairs each row with its handler; clients use the
// rows to name commands and explain refusals.
#pragma once

#include <array>
#include <cstdint>

namespace berth {

inline constexpr const char* kBTHEntitlementNone = "sys.kelp.private.Berth.none";
inline constexpr const char* kBTHEntitlementAllowed = "sys.kelp.private.Berth.allowed";
inline constexpr const char* kBTHEntitlementOtherIdLookup = "sys.kelp.private.Berth.otherIdLookup";
inline constexpr const char* kBTHEntitlementWipeContainer = "sys.kelp.private.Berth.wipeContainer";
inline constexpr const char* kBTHEntitlementDataMigration = "sys.kelp.private.Berth.dataMigration";
inline constexpr const char* kBTHEntitlementStageSharedContent =
    "sys.kelp.private.Berth.stageSharedContent";
inline constexpr const char* kBTHEntitlementNetworkExtension =
    "sys.kelp.private.Berth.networkExtension";
inline constexpr const char* kBTHEntitlementUserManagedAssets =
    "sys.kelp.private.Berth.userManagedAssets";

struct BTHCommandInfo {
    uint64_t command;
    const char* name;
    const char* requiredEntitlement;
    uint32_t repliesAtOnce;  // 1: when the handler returns; 0: from its completion
};

inline constexpr uint64_t kBTHCommandCount = 30;

// Indexed by command number.
const std::array<BTHCommandInfo, kBTHCommandCount>& BTHCommands();

}  // namespace berth
