// The handlers of the maintenance commands: the data migration (24), asked
// for by the platform's data-migration step, and the retry test (25), which
// exercises clients' retrying by making the daemon exit on purpose.
#pragma once

#include <cstdint>
#include <memory>

#include "BTHClientConnection.h"
#include "BTHRequest.h"

namespace berth {

// 24: no keys; on failure the reply error is the migration error's code.
void performDataMigration(const BTHRequestRef& request,
                          const std::shared_ptr<BTHClientConnection>& client, uint64_t* replyError);
// 25: "UserID" (validated against class 2), "NumRetryCrashes"; internal
// builds only, elsewhere nothing is done and the reply error stays 1.
void retryTest(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
               uint64_t* replyError);

}  // namespace berth
