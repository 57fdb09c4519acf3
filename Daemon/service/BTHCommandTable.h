// The 30 commands of the request socket, indexed by command number: the
// handler, the entitlement the caller needs, and whether the request
// processor replies when the handler returns (1) or the handler's completion
// does (0).
#pragma once

#include <array>
#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

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

// Reads its keys from the request, calls one operation, adds its reply keys,
// and writes a failure code through `replyError` (which starts at 1).
using BTHCommandHandler = void (*)(const BTHRequestRef& request,
                                   const std::shared_ptr<BTHClientConnection>& client,
                                   uint64_t* replyError);

struct BTHCommandRow {
    uint64_t command;
    const char* name;
    BTHCommandHandler handler;
    const char* requiredEntitlement;
    uint32_t repliesAtOnce;
    uint32_t spare;
};

inline constexpr uint64_t kBTHCommandCount = 30;

const std::array<BTHCommandRow, kBTHCommandCount>& BTHCommandTable();

// Sets "ReplyError" to `code` on the request's reply and sends it: the
// completion of the commands that reply asynchronously.
void BTHSendAsynchronousReply(const BTHRequestRef& request, uint64_t code);

}  // namespace berth
