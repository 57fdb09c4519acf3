// The assertion as it stands where no termination service is connected yet:
// taking it succeeds at once without terminating anything, and invalidating
// it releases it. The reason is still checked, since a wrong one is the
// caller's error whatever the service.
#include "BTHApplicationTerminationAssertion.h"

#include <cstdlib>

#include "BTHLog.h"

namespace berth {

namespace {

const char* reasonString(int reason) {
    BTH_FUNCTION("_GangwayApplicationTerminationReasonStringForReason");
    switch (reason) {
        case 0:
            return "installation";
        case 1:
            return "cache deletion";
        case 255:
            return "critical";
        default:
            BTHLogError("Unknown reason: %d", reason);
            std::abort();
    }
}

}  // namespace

BTHApplicationTerminationAssertion::BTHApplicationTerminationAssertion(std::string identifier)
    : identifier_(std::move(identifier)), termAssertion_(true) {}

std::unique_ptr<BTHApplicationTerminationAssertion>
BTHApplicationTerminationAssertion::initWithBundleIdentifier(const std::string& identifier,
                                                             int reason) {
    BTH_FUNCTION("-[BTHApplicationTerminationAssertion initWithBundleIdentifier:reason:]");
    const char* why = reasonString(reason);
    BTHLogDebug("Holding %@ terminated (%s): no termination service to ask", identifier, why);
    return std::unique_ptr<BTHApplicationTerminationAssertion>(
        new BTHApplicationTerminationAssertion(identifier));
}

BTHApplicationTerminationAssertion::~BTHApplicationTerminationAssertion() {
    if (termAssertion_) {
        BTH_FUNCTION("-[BTHApplicationTerminationAssertion dealloc]");
        BTHLogError("nil == _termAssertion");
        std::abort();
    }
}

void BTHApplicationTerminationAssertion::invalidate() {
    termAssertion_ = false;
}

}  // namespace berth
