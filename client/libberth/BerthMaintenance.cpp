#include "libberth/BerthMaintenance.h"

namespace berth {

Value makePerformDataMigrationRequest() {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandPerformDataMigration});
    return request;
}

Value makeRetryTestRequest(uint32_t user, uint64_t crashes) {
    Value request = Value::dictionary();
    request.set("Command", uint64_t{kBerthCommandRetryTest});
    request.set("UserID", uint64_t{user});
    request.set("NumRetryCrashes", crashes);
    return request;
}

bool BerthMaintenance::exchange(const Value& request, ContainerError* error) {
    BerthError failure;
    const std::optional<Value> reply = connection_.request(request, timeout_, &failure);
    if (!reply) {
        if (error) {
            error->text = failure.message;
            error->transport = std::move(failure);
        }
        return false;
    }
    return decodeReplyStatus(*reply, error);
}

bool BerthMaintenance::performDataMigration(ContainerError* error) {
    return exchange(makePerformDataMigrationRequest(), error);
}

bool BerthMaintenance::retryTest(uint32_t user, uint64_t crashes, ContainerError* error) {
    return exchange(makeRetryTestRequest(user, crashes), error);
}

}  // namespace berth
