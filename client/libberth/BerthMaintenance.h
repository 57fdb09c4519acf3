// Typed calls of berthd's maintenance commands.
//
//   berth::BerthMaintenance maintenance(*connection);
//   berth::ContainerError failure;
//   if (!maintenance.performDataMigration(&failure)) fail(failure.describe());
//
//   command  call                  entitlement ("sys.kelp.private.Berth." ...)
//   24       performDataMigration  .performDataMigration
//   25       retryTest             .retryTest; internal builds only (elsewhere
//                                  the daemon does nothing and answers success)
//
// The retry test makes the daemon exit on purpose: while its countdown is
// above 0 the request gets no reply and the connection ends (a transport
// error), and the caller is expected to connect again and repeat it.
#pragma once

#include <chrono>
#include <cstdint>

#include "libberth/BerthContainers.h"

namespace berth {

enum BerthMaintenanceCommand : uint64_t {
    kBerthCommandPerformDataMigration = 24,
    kBerthCommandRetryTest = 25,
};

Value makePerformDataMigrationRequest();
// `user` 1 is the caller's own user.
Value makeRetryTestRequest(uint32_t user, uint64_t crashes);

class BerthMaintenance {
  public:
    explicit BerthMaintenance(BerthConnection& connection,
                              std::chrono::milliseconds timeout = std::chrono::minutes(5))
        : connection_(connection), timeout_(timeout) {}

    // Command 24: moves data older releases left into place; true on success.
    bool performDataMigration(ContainerError* error = nullptr);
    // Command 25: one round of the retry test; true once it succeeded. A
    // round that ended the daemon fails with a transport error.
    bool retryTest(uint32_t user, uint64_t crashes, ContainerError* error = nullptr);

  private:
    bool exchange(const Value& request, ContainerError* error);

    BerthConnection& connection_;
    std::chrono::milliseconds timeout_;
};

}  // namespace berth
