#include "BTHMaintenanceCommands.h"

#include "BTHContainerMigrator.h"
#include "BTHLog.h"
#include "BTHRequestIntake.h"
#include "BTHRequestReaders.h"
#include "core/BTHContainerClass.h"
#include "platform/DeviceProperties.h"

namespace berth {

void performDataMigration(const BTHRequestRef&, const std::shared_ptr<BTHClientConnection>&,
                          uint64_t* replyError) {
    BTH_FUNCTION("performDataMigration");
    BTHErrorRef error;
    if (BTHContainerMigrator::sharedInstance().performDataMigratorMigrationWithError(&error))
        return;
    BTHLogError("Failed to perform data migration : %@", error);
    *replyError = error ? error->code64() : uint64_t{BTHErrorException};
}

void retryTest(const BTHRequestRef& request, const std::shared_ptr<BTHClientConnection>& client,
               uint64_t* replyError) {
    BTH_FUNCTION("retryTest");
    if (!DeviceProperties::isInternalBuild()) {
        BTHLogError("People really shouldn't be calling this on non-internal installs!");
        return;
    }
    const Value& message = request->message();
    uint32_t user = 0;
    if (!validateUserId(static_cast<uint32_t>(BTHRequestUInt64(message, "UserID")),
                        BTHContainerClassDataApplication, client->clientUserId(), &user,
                        replyError))
        return;
    client->retryTestForUser(user, BTHRequestUInt64(message, "NumRetryCrashes"), replyError);
}

}  // namespace berth
