// The handler of the disk-usage command: how many bytes one container's
// files occupy.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// Command 23. "ReplyDiskUsage" is in every reply whose user was valid, 0
// when the measurement failed.
void diskUsage(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
               uint64_t* replyError);

}  // namespace berth
